// Reading the store's history. Each call reads inside one read transaction,
// so the rows are one consistent view while writers go on, and calls its
// handler once per row, synchronously. Samples stream from the database:
// memory stays flat however many samples a day has.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

struct sqlite3;
struct sqlite3_stmt;

namespace platform {

class TallyStore;

// Told of a row that holds what its column cannot mean (text or a blob
// where a number is kept, a real out of an integer's range, planted by
// hand or by another program): the sentence says which row and what it
// holds. The row is left out of what the handlers see.
using BadRowHandler = std::function<void(const std::string& sentence)>;

class TBHistoryDistributionEnumerator {
 public:
  // False when no sample is left, or when the store could not be read: the
  // history call then reports the failure. A bad sample is skipped.
  bool getNextValue(double* value, int32_t* secondsInDayOffset);

 private:
  friend class TBHistory;
  TBHistoryDistributionEnumerator(sqlite3_stmt* stmt, const std::string& key, int32_t day, const BadRowHandler& bad)
      : stmt_(stmt), key_(key), day_(day), bad_(bad) {}
  sqlite3_stmt* stmt_;
  const std::string& key_;
  int32_t day_;
  const BadRowHandler& bad_;
  bool done_ = false;
  int error_ = 0;  // the SQLite result that ended the samples early
};

class TBHistory {
 public:
  using ScalarHandler = std::function<void(const std::string& key, int32_t day, int64_t value, bool* stop)>;
  using DistributionHandler = std::function<void(const std::string& key, int32_t day,
                                                 TBHistoryDistributionEnumerator& samples, bool* stop)>;

  // The store at the default device path; null when it cannot be opened.
  static std::unique_ptr<TBHistory> initWithDefaultPath(std::string* error = nullptr);
  static std::unique_ptr<TBHistory> initWithPath(const std::string& path, std::string* error = nullptr);
  ~TBHistory();

  // Where bad rows are told; by default each is one error line.
  void setBadRowHandler(BadRowHandler handler) { bad_ = std::move(handler); }

  // Rows of the days after min, up to and including max (min < day <= max),
  // whose key starts with prefix, ordered by day, then key: the report asks
  // for (D - 1, D] and gets exactly day D. False when the store could not be
  // read, even part-way: the rows delivered are then not the whole answer.
  // A read error is logged, and corruption is counted in the preference
  // kStoreCorruptionKey of kStoreCorruptionDomain.
  bool scalarsForKeyPrefix(std::string_view prefix, int32_t minDaysSince1970, int32_t maxDaysSince1970,
                           const ScalarHandler& rowHandler);
  // One row per key and day, in the same order; the enumerator yields that
  // key's samples in the order they were pushed and is valid only inside
  // the handler.
  bool distributionsForKeyPrefix(std::string_view prefix, int32_t minDaysSince1970, int32_t maxDaysSince1970,
                                 const DistributionHandler& rowHandler);

 private:
  explicit TBHistory(std::unique_ptr<TallyStore> store);
  std::unique_ptr<TallyStore> store_;
  sqlite3* db_;
  BadRowHandler bad_;
};

}  // namespace platform
