// The statistics store (Tallybook): SQLite in WAL mode at
// $ROOT/var/mobile/Library/Tallybook/TBDataStore.sqlitedb.
//
// Scalars hold one signed 64-bit value per key and day; distributions hold,
// per key and day, a list of double samples with their offset in seconds
// within the day. Several processes write during the day; every write is one
// immediate transaction, so none is lost.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "cf/value.h"

struct sqlite3;

namespace platform {

inline constexpr const char* kStoreDevicePath = "/var/mobile/Library/Tallybook/TBDataStore.sqlitedb";
inline constexpr int kStoreSchemaVersion = 1;
// Where the store's components count the corruptions they meet; the report
// reads the count and sets it back to 0.
inline constexpr const char* kStoreCorruptionDomain = "com.velmora.tallybookd";
inline constexpr const char* kStoreCorruptionKey = "DatabaseCorruptionCount";

class TallyStore {
 public:
  enum class Mode { kCreate, kExisting };
  // Null with a reason in *error when the file is not a store, is a newer
  // schema, or cannot be opened. A file that is not a store is never written.
  static std::unique_ptr<TallyStore> Open(const std::string& path, Mode mode, std::string* error);
  ~TallyStore();

  // Writes refuse a key that a property list cannot carry (cf::IsPropertyListString):
  // one such key would keep the whole day's log from being written.
  bool SetScalar(int32_t day, std::string_view key, int64_t value);
  // Refuses a sum past the signed 64-bit range and leaves the value as it was.
  bool AddScalar(int32_t day, std::string_view key, int64_t value);
  bool PushSample(int32_t day, std::string_view key, double value, int32_t seconds_in_day);
  // Many samples of one key in one transaction (tools and benchmarks).
  bool PushSamples(int32_t day, std::string_view key, const std::vector<std::pair<double, int32_t>>& samples);
  // Many operations in one transaction; the body's writes use the methods above.
  bool Batch(const std::function<bool()>& body);
  // Waits (up to the busy timeout) for a concurrent writer or checkpointer.
  bool Checkpoint();
  const std::string& last_error() const { return last_error_; }
  // Whether the last failure was the caller's input (a bad key, an overflowing
  // sum) rather than the store itself.
  bool last_error_is_bad_input() const { return bad_input_; }
  const std::string& path() const { return path_; }
  sqlite3* handle() { return db_; }

 private:
  TallyStore(sqlite3* db, std::string path) : db_(db), path_(std::move(path)) {}
  bool Exec(const char* sql);
  bool WriteScalar(const char* sql, const char* what, int32_t day, std::string_view key, int64_t value);
  bool EnableWriteAheadLog();
  bool Fail(const char* what);
  bool BadInput(std::string why);
  bool CheckKey(std::string_view key);
  bool InTransaction(const std::function<bool()>& body);

  sqlite3* db_;
  std::string path_;
  std::string last_error_;
  bool bad_input_ = false;
  int batch_depth_ = 0;
};

// Whole days since 1970-01-01 in the local time zone (TZ) at the instant t.
int32_t DaysSince1970At(double t);
// The instant at which a local day begins.
double StartOfDay(int32_t day);

}  // namespace platform

// ---- the store client's calls, over the current context ----

int32_t TBDaysSince1970();
bool TBClientSetValueForScalarKey(std::string_view key, int64_t value);
bool TBClientAddValueForScalarKey(std::string_view key, int64_t value);
bool TBClientPushValueForDistributionKey(std::string_view key, double value, int32_t secondsInDayOffset);
// Runs body, whose client calls above then share one transaction: many keys
// written at once cost one commit instead of one each.
bool TBClientWriteInOneTransaction(const std::function<void()>& body);
bool TBClientCheckpoint();
// The start of a day in the store's time zone.
cf::Date dateForDaysSince1970(int32_t day);
