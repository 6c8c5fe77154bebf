#include "platform/history.h"

#include <sqlite3.h>

#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/prefs.h"
#include "platform/run_record.h"
#include "platform/store.h"

namespace platform {

namespace {

// Rows whose key starts with the prefix: a range on the key, so the empty
// prefix costs nothing and a long one uses the ordering of the text.
constexpr const char* kPrefixClause =
    " AND (?3 = '' OR (key >= ?3 AND substr(key, 1, length(?3)) = ?3))";

class ReadTransaction {
 public:
  explicit ReadTransaction(sqlite3* db) : db_(db), result_(sqlite3_exec(db, "BEGIN", nullptr, nullptr, nullptr)) {}
  ~ReadTransaction() {
    if (ok()) sqlite3_exec(db_, "COMMIT", nullptr, nullptr, nullptr);
  }
  bool ok() const { return result_ == SQLITE_OK; }
  int result() const { return result_; }

 private:
  sqlite3* db_;
  int result_;
};

struct Finalizer {
  void operator()(sqlite3_stmt* s) const { sqlite3_finalize(s); }
};
using StatementPtr = std::unique_ptr<sqlite3_stmt, Finalizer>;

// A read that did not finish: an error line, and a count of the corruption
// for the next report, written at once since this process may not get far.
bool ReadFailed(sqlite3* db, int rc) {
  LogError("Tallybook history read failed: %s", sqlite3_errmsg(db));
  NoteRunFailure(std::string("the store could not be read: ") + sqlite3_errmsg(db));
  const int primary = rc & 0xff;
  if (primary == SQLITE_CORRUPT || primary == SQLITE_NOTADB) {
    const int64_t count = DGVPreferencesGetIntegerValue(kStoreCorruptionKey, kStoreCorruptionDomain);
    DGVPreferencesSetValue(kStoreCorruptionKey, cf::Value::SInt64(count + 1), kStoreCorruptionDomain);
    DGVPreferencesSynchronize(kStoreCorruptionDomain);
  }
  return false;
}

StatementPtr Prepare(sqlite3* db, const std::string& sql) {
  sqlite3_stmt* s = nullptr;
  const int rc = sqlite3_prepare_v2(db, sql.c_str(), -1, &s, nullptr);
  if (rc != SQLITE_OK) {
    ReadFailed(db, rc);
    return nullptr;
  }
  return StatementPtr(s);
}

void BindRange(sqlite3_stmt* s, std::string_view prefix, int32_t min_day, int32_t max_day) {
  sqlite3_bind_int(s, 1, min_day);
  sqlite3_bind_int(s, 2, max_day);
  sqlite3_bind_text(s, 3, prefix.data(), static_cast<int>(prefix.size()), SQLITE_STATIC);
}

}  // namespace

bool TBHistoryDistributionEnumerator::getNextValue(double* value, int32_t* secondsInDayOffset) {
  if (done_ || !stmt_) return false;
  const int rc = sqlite3_step(stmt_);
  if (rc != SQLITE_ROW) {
    done_ = true;
    if (rc != SQLITE_DONE) error_ = rc;
    return false;
  }
  if (value) *value = sqlite3_column_double(stmt_, 0);
  if (secondsInDayOffset) *secondsInDayOffset = sqlite3_column_int(stmt_, 1);
  return true;
}

std::unique_ptr<TBHistory> TBHistory::initWithDefaultPath(std::string* error) {
  std::string why;
  auto history = initWithPath(Context::Current().Path(kStoreDevicePath), &why);
  if (!history) NoteRunFailure("the store could not be opened: " + why);
  if (error) *error = why;
  return history;
}

std::unique_ptr<TBHistory> TBHistory::initWithPath(const std::string& path, std::string* error) {
  // The store's own open refuses foreign files without touching them; its
  // connection is the one the history reads through.
  std::unique_ptr<TallyStore> store = TallyStore::Open(path, TallyStore::Mode::kExisting, error);
  if (!store) return nullptr;
  return std::unique_ptr<TBHistory>(new TBHistory(std::move(store)));
}

TBHistory::TBHistory(std::unique_ptr<TallyStore> store) : store_(std::move(store)), db_(store_->handle()) {}
TBHistory::~TBHistory() = default;

bool TBHistory::scalarsForKeyPrefix(std::string_view prefix, int32_t minDaysSince1970, int32_t maxDaysSince1970,
                                    const ScalarHandler& rowHandler) {
  ReadTransaction txn(db_);
  if (!txn.ok()) return ReadFailed(db_, txn.result());
  StatementPtr rows = Prepare(db_, std::string("SELECT key, day, value FROM scalars WHERE day > ?1 AND day <= ?2") +
                                       kPrefixClause + " ORDER BY day, key");
  if (!rows) return false;
  BindRange(rows.get(), prefix, minDaysSince1970, maxDaysSince1970);
  std::string key;
  int rc;
  while ((rc = sqlite3_step(rows.get())) == SQLITE_ROW) {
    key.assign(reinterpret_cast<const char*>(sqlite3_column_text(rows.get(), 0)),
               static_cast<size_t>(sqlite3_column_bytes(rows.get(), 0)));
    bool stop = false;
    rowHandler(key, sqlite3_column_int(rows.get(), 1), sqlite3_column_int64(rows.get(), 2), &stop);
    if (stop) return true;
  }
  return rc == SQLITE_DONE || ReadFailed(db_, rc);
}

bool TBHistory::distributionsForKeyPrefix(std::string_view prefix, int32_t minDaysSince1970,
                                          int32_t maxDaysSince1970, const DistributionHandler& rowHandler) {
  ReadTransaction txn(db_);
  if (!txn.ok()) return ReadFailed(db_, txn.result());
  StatementPtr rows = Prepare(db_, std::string("SELECT id, key, day FROM series WHERE day > ?1 AND day <= ?2") +
                                       kPrefixClause + " ORDER BY day, key");
  StatementPtr samples = Prepare(db_, "SELECT value, offset FROM samples WHERE series = ?1 ORDER BY seq");
  if (!rows || !samples) return false;
  BindRange(rows.get(), prefix, minDaysSince1970, maxDaysSince1970);
  std::string key;
  int rc;
  while ((rc = sqlite3_step(rows.get())) == SQLITE_ROW) {
    key.assign(reinterpret_cast<const char*>(sqlite3_column_text(rows.get(), 1)),
               static_cast<size_t>(sqlite3_column_bytes(rows.get(), 1)));
    sqlite3_reset(samples.get());
    sqlite3_bind_int64(samples.get(), 1, sqlite3_column_int64(rows.get(), 0));
    TBHistoryDistributionEnumerator enumerator(samples.get());
    bool stop = false;
    rowHandler(key, sqlite3_column_int(rows.get(), 2), enumerator, &stop);
    if (enumerator.error_ != 0) return ReadFailed(db_, enumerator.error_);
    if (stop) return true;
  }
  return rc == SQLITE_DONE || ReadFailed(db_, rc);
}

}  // namespace platform
