#include "platform/history.h"

#include <sqlite3.h>

#include <climits>
#include <cstdio>

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

// What a column holds that is not a number of the kind wanted; empty when
// it is one. Integers must be stored as integers; reals may be either.
std::string NotANumber(sqlite3_stmt* s, int column, bool integer) {
  switch (sqlite3_column_type(s, column)) {
    case SQLITE_INTEGER: return {};
    case SQLITE_FLOAT: {
      if (!integer) return {};
      char text[64];
      std::snprintf(text, sizeof text, "%.15g", sqlite3_column_double(s, column));
      return std::string("the real ") + text;
    }
    case SQLITE_TEXT: {
      std::string text(reinterpret_cast<const char*>(sqlite3_column_text(s, column)),
                       static_cast<size_t>(sqlite3_column_bytes(s, column)));
      if (text.size() > 40) text = text.substr(0, 40) + "...";
      return "the text \"" + text + "\"";
    }
    case SQLITE_BLOB: return "a blob of " + std::to_string(sqlite3_column_bytes(s, column)) + " bytes";
    default: return "nothing (NULL)";
  }
}

void TellBadRow(const BadRowHandler& bad, const std::string& sentence) {
  if (bad) bad(sentence);
  else LogError("%s", sentence);
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
  while (!done_ && stmt_) {
    const int rc = sqlite3_step(stmt_);
    if (rc != SQLITE_ROW) {
      done_ = true;
      if (rc != SQLITE_DONE) error_ = rc;
      return false;
    }
    std::string what = NotANumber(stmt_, 0, false);
    if (!what.empty()) what += ", not a number";
    const int64_t offset = sqlite3_column_int64(stmt_, 1);
    if (what.empty()) {
      const std::string odd = NotANumber(stmt_, 1, true);
      if (!odd.empty() || offset < INT32_MIN || offset > INT32_MAX)
        what = (odd.empty() ? std::to_string(offset) : odd) + " as its offset, not a 32-bit second of the day";
    }
    if (!what.empty()) {
      TellBadRow(bad_, "The store's sample of " + key_ + " on day " + std::to_string(day_) + " holds " + what +
                           "; it is skipped");
      continue;
    }
    if (value) *value = sqlite3_column_double(stmt_, 0);
    if (secondsInDayOffset) *secondsInDayOffset = static_cast<int32_t>(offset);
    return true;
  }
  return false;
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
    if (const std::string what = NotANumber(rows.get(), 2, true); !what.empty()) {
      TellBadRow(bad_, "The store's scalar " + key + " of day " + std::to_string(sqlite3_column_int(rows.get(), 1)) +
                           " holds " + what + ", not a 64-bit integer; it is skipped");
      continue;
    }
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
    const int32_t day = sqlite3_column_int(rows.get(), 2);
    TBHistoryDistributionEnumerator enumerator(samples.get(), key, day, bad_);
    bool stop = false;
    rowHandler(key, day, enumerator, &stop);
    if (enumerator.error_ != 0) return ReadFailed(db_, enumerator.error_);
    if (stop) return true;
  }
  return rc == SQLITE_DONE || ReadFailed(db_, rc);
}

}  // namespace platform
