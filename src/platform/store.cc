#include "platform/store.h"

#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstring>
#include <ctime>
#include <thread>

#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"

namespace platform {

namespace {

constexpr int kBusyTimeoutMs = 30000;

// Samples are clustered by series so a day's samples of one key stream in
// order with one range scan.
constexpr const char* kSchema = R"sql(
CREATE TABLE scalars(
  day INTEGER NOT NULL,
  key TEXT NOT NULL,
  value INTEGER NOT NULL,
  PRIMARY KEY(day, key)) WITHOUT ROWID;
CREATE TABLE series(
  id INTEGER PRIMARY KEY,
  day INTEGER NOT NULL,
  key TEXT NOT NULL,
  UNIQUE(day, key));
CREATE TABLE samples(
  series INTEGER NOT NULL,
  seq INTEGER NOT NULL,
  value REAL NOT NULL,
  offset INTEGER NOT NULL,
  PRIMARY KEY(series, seq)) WITHOUT ROWID;
)sql";

class Statement {
 public:
  Statement(sqlite3* db, const char* sql) { sqlite3_prepare_v2(db, sql, -1, &stmt_, nullptr); }
  ~Statement() { sqlite3_finalize(stmt_); }
  sqlite3_stmt* get() { return stmt_; }
  explicit operator bool() const { return stmt_ != nullptr; }

 private:
  sqlite3_stmt* stmt_ = nullptr;
};

std::string Lowered(const char* text) {
  std::string s = text;
  if (!s.empty()) s[0] = static_cast<char>(std::tolower(static_cast<unsigned char>(s[0])));
  return s;
}

// When SQLite cannot open or read a store, the cause is often access, not
// content: say so plainly, so that a read-only directory is not taken for a
// foreign file. Empty when access is not the problem.
std::string AccessProblem(const std::string& path) {
  if (access(path.c_str(), R_OK | W_OK) != 0 && errno != ENOENT) {
    const int cause = errno;
    return "the file cannot be read and written (" + Lowered(std::strerror(cause)) + ")";
  }
  const size_t slash = path.find_last_of('/');
  const std::string dir = slash == std::string::npos ? "." : slash == 0 ? "/" : path.substr(0, slash);
  if (access(dir.c_str(), W_OK | X_OK) != 0) {
    const int cause = errno;
    return "its directory " + dir + " is not writable (" + Lowered(std::strerror(cause)) +
           "), and the store keeps its write-ahead log beside it";
  }
  return {};
}

}  // namespace

std::unique_ptr<TallyStore> TallyStore::Open(const std::string& path, Mode mode, std::string* error) {
  auto fail = [&](const std::string& why) -> std::unique_ptr<TallyStore> {
    if (error) *error = why;
    return nullptr;
  };
  if (mode == Mode::kCreate) {
    const size_t slash = path.find_last_of('/');
    if (slash != std::string::npos && slash > 0 && !MakeDirectories(path.substr(0, slash))) {
      const int cause = errno;
      return fail("cannot create the directory of " + path + " (" + Lowered(std::strerror(cause)) + ")");
    }
  } else if (!FileExists(path)) {
    return fail("no store at " + path);
  }
  // The store, its write-ahead log and its shared-memory index are used
  // only where they stand: a link planted at any of them (or at a directory
  // below the root) would send the job's writes elsewhere.
  const size_t slash = path.find_last_of('/');
  std::string why;
  if (slash != std::string::npos && slash > 0 && !Directory::Open(path.substr(0, slash), false, &why))
    return fail("cannot open store " + path + ": " + why);
  for (const char* suffix : {"", "-wal", "-shm"}) {
    struct stat st;
    const std::string file = path + suffix;
    if (lstat(file.c_str(), &st) != 0) continue;
    if (S_ISLNK(st.st_mode)) return fail(file + " is a symbolic link; refusing to open the store through it");
    if (!S_ISREG(st.st_mode)) return fail(file + " is not a regular file; refusing to open the store");
  }
  sqlite3* db = nullptr;
  const int flags = SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_NOFOLLOW |
                    (mode == Mode::kCreate ? SQLITE_OPEN_CREATE : 0);
  if (sqlite3_open_v2(path.c_str(), &db, flags, nullptr) != SQLITE_OK) {
    std::string why = AccessProblem(path);
    if (why.empty()) why = db ? sqlite3_errmsg(db) : "out of memory";
    sqlite3_close(db);
    return fail("cannot open store " + path + ": " + why);
  }
  std::unique_ptr<TallyStore> store(new TallyStore(db, path));
  sqlite3_busy_timeout(db, kBusyTimeoutMs);

  // Look before touching anything: a file that is not a store must stay as it is.
  int version = 0;
  int foreign_tables = 0;
  {
    Statement st(db, "SELECT count(*) FROM sqlite_master WHERE type='table' AND name NOT IN ('scalars','series','samples')");
    if (!st || sqlite3_step(st.get()) != SQLITE_ROW) {
      const std::string why = AccessProblem(path);
      if (!why.empty()) return fail("cannot open store " + path + ": " + why);
      // A full disk or a failing one is no verdict on the file.
      const int code = sqlite3_errcode(db);
      if (code == SQLITE_IOERR || code == SQLITE_FULL || code == SQLITE_CANTOPEN)
        return fail("cannot read store " + path + ": " + sqlite3_errmsg(db) + " (is the disk full?)");
      return fail(path + " is not a Tallybook store (" + sqlite3_errmsg(db) + ")");
    }
    foreign_tables = sqlite3_column_int(st.get(), 0);
  }
  {
    Statement st(db, "PRAGMA user_version");
    if (!st || sqlite3_step(st.get()) != SQLITE_ROW)
      return fail(path + " is not a Tallybook store (" + sqlite3_errmsg(db) + ")");
    version = sqlite3_column_int(st.get(), 0);
  }
  if (version > kStoreSchemaVersion)
    return fail(path + " has store schema version " + std::to_string(version) +
                ", newer than this program understands (" + std::to_string(kStoreSchemaVersion) + ")");
  if (version == 0 && foreign_tables > 0)
    return fail(path + " is an SQLite database but not a Tallybook store");
  if (version != 0 && version < kStoreSchemaVersion)
    return fail(path + " has unknown store schema version " + std::to_string(version));

  if (!store->EnableWriteAheadLog()) {
    const std::string why = AccessProblem(path);
    return fail(why.empty() ? store->last_error_ : "cannot open store " + path + ": " + why);
  }
  store->Exec("PRAGMA synchronous=NORMAL");
  if (version == 0) {
    // Another process may be creating the schema at the same moment: decide
    // inside the write lock.
    const bool ok = store->InTransaction([&] {
      Statement st(db, "PRAGMA user_version");
      if (!st || sqlite3_step(st.get()) != SQLITE_ROW) return store->Fail("read schema version");
      if (sqlite3_column_int(st.get(), 0) != 0) return true;
      return store->Exec(kSchema) && store->Exec("PRAGMA user_version=1");
    });
    if (!ok) return fail(store->last_error_);
  }
  return store;
}

TallyStore::~TallyStore() { sqlite3_close_v2(db_); }

bool TallyStore::EnableWriteAheadLog() {
  // Switching the journal mode takes an exclusive lock without consulting the
  // busy handler, so several processes opening a new store at once retry here.
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(kBusyTimeoutMs);
  for (int attempt = 0;; ++attempt) {
    Statement st(db_, "PRAGMA journal_mode=WAL");
    const int rc = st ? sqlite3_step(st.get()) : SQLITE_ERROR;
    if (rc == SQLITE_ROW) return true;
    if ((rc != SQLITE_BUSY && rc != SQLITE_LOCKED) || std::chrono::steady_clock::now() > deadline)
      return Fail("PRAGMA journal_mode=WAL");
    std::this_thread::sleep_for(std::chrono::milliseconds(1 + attempt % 10));
  }
}

bool TallyStore::Fail(const char* what) {
  last_error_ = std::string(what) + ": " + sqlite3_errmsg(db_);
  bad_input_ = false;
  return false;
}

bool TallyStore::BadInput(std::string why) {
  last_error_ = std::move(why);
  bad_input_ = true;
  return false;
}

bool TallyStore::CheckKey(std::string_view key) {
  std::string why;
  return cf::IsPropertyListString(key, &why) || BadInput("key cannot be stored, a property list cannot carry it: " + why);
}

bool TallyStore::Exec(const char* sql) {
  char* msg = nullptr;
  if (sqlite3_exec(db_, sql, nullptr, nullptr, &msg) != SQLITE_OK) {
    last_error_ = std::string(sql).substr(0, 40) + ": " + (msg ? msg : sqlite3_errmsg(db_));
    sqlite3_free(msg);
    return false;
  }
  return true;
}

bool TallyStore::InTransaction(const std::function<bool()>& body) {
  if (batch_depth_ > 0) return body();
  if (!Exec("BEGIN IMMEDIATE")) return false;
  ++batch_depth_;
  const bool ok = body();
  --batch_depth_;
  if (!ok) {
    Exec("ROLLBACK");
    return false;
  }
  if (!Exec("COMMIT")) {
    Exec("ROLLBACK");
    return false;
  }
  return true;
}

bool TallyStore::Batch(const std::function<bool()>& body) { return InTransaction(body); }

bool TallyStore::WriteScalar(const char* sql, const char* what, int32_t day, std::string_view key, int64_t value) {
  if (!CheckKey(key)) return false;
  Statement st(db_, sql);
  if (!st) return Fail(what);
  sqlite3_bind_int(st.get(), 1, day);
  sqlite3_bind_text(st.get(), 2, key.data(), static_cast<int>(key.size()), SQLITE_STATIC);
  sqlite3_bind_int64(st.get(), 3, value);
  return sqlite3_step(st.get()) == SQLITE_DONE || Fail(what);
}

bool TallyStore::SetScalar(int32_t day, std::string_view key, int64_t value) {
  return WriteScalar("INSERT INTO scalars(day, key, value) VALUES(?1, ?2, ?3) "
                     "ON CONFLICT(day, key) DO UPDATE SET value = excluded.value",
                     "set scalar", day, key, value);
}

bool TallyStore::AddScalar(int32_t day, std::string_view key, int64_t value) {
  // One statement: the read and the write happen under the same write lock,
  // so concurrent adders never lose each other's increments. SQLite would
  // turn an overflowing sum into a real that then sticks, so a sum past the
  // range leaves the row alone, and no change at all tells us so.
  if (!WriteScalar("INSERT INTO scalars(day, key, value) VALUES(?1, ?2, ?3) "
                   "ON CONFLICT(day, key) DO UPDATE SET value = value + excluded.value "
                   "WHERE (excluded.value >= 0 AND value <= 9223372036854775807 - excluded.value) "
                   "OR (excluded.value < 0 AND value >= -9223372036854775807 - 1 - excluded.value)",
                   "add scalar", day, key, value))
    return false;
  if (sqlite3_changes(db_) > 0) return true;
  return BadInput("adding " + std::to_string(value) + " to " + std::string(key) +
                  " would take its value past the signed 64-bit range");
}

bool TallyStore::PushSamples(int32_t day, std::string_view key,
                             const std::vector<std::pair<double, int32_t>>& samples) {
  if (!CheckKey(key)) return false;
  return InTransaction([&] {
    Statement series(db_, "INSERT INTO series(day, key) VALUES(?1, ?2) ON CONFLICT(day, key) DO UPDATE SET day = day "
                          "RETURNING id");
    if (!series) return Fail("prepare series");
    sqlite3_bind_int(series.get(), 1, day);
    sqlite3_bind_text(series.get(), 2, key.data(), static_cast<int>(key.size()), SQLITE_STATIC);
    if (sqlite3_step(series.get()) != SQLITE_ROW) return Fail("find series");
    const int64_t id = sqlite3_column_int64(series.get(), 0);
    sqlite3_reset(series.get());

    Statement last(db_, "SELECT IFNULL(MAX(seq), 0) FROM samples WHERE series = ?1");
    if (!last) return Fail("prepare sample sequence");
    sqlite3_bind_int64(last.get(), 1, id);
    if (sqlite3_step(last.get()) != SQLITE_ROW) return Fail("read sample sequence");
    int64_t seq = sqlite3_column_int64(last.get(), 0);

    Statement insert(db_, "INSERT INTO samples(series, seq, value, offset) VALUES(?1, ?2, ?3, ?4)");
    if (!insert) return Fail("prepare sample");
    for (const auto& [value, offset] : samples) {
      sqlite3_bind_int64(insert.get(), 1, id);
      sqlite3_bind_int64(insert.get(), 2, ++seq);
      sqlite3_bind_double(insert.get(), 3, value);
      sqlite3_bind_int(insert.get(), 4, offset);
      if (sqlite3_step(insert.get()) != SQLITE_DONE) return Fail("push sample");
      sqlite3_reset(insert.get());
    }
    return true;
  });
}

bool TallyStore::PushSample(int32_t day, std::string_view key, double value, int32_t seconds_in_day) {
  return PushSamples(day, key, {{value, seconds_in_day}});
}

bool TallyStore::Checkpoint() {
  // A passive checkpoint never calls the busy handler: while another
  // connection checkpoints (a writer's automatic one, say) it fails at once
  // with "database is locked". Wait for it as the busy timeout would.
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(kBusyTimeoutMs);
  for (int attempt = 0;; ++attempt) {
    int log_frames = 0, checkpointed = 0;
    const int rc = sqlite3_wal_checkpoint_v2(db_, nullptr, SQLITE_CHECKPOINT_PASSIVE, &log_frames, &checkpointed);
    if (rc == SQLITE_OK) return true;
    if ((rc != SQLITE_BUSY && rc != SQLITE_LOCKED) || std::chrono::steady_clock::now() > deadline)
      return Fail("checkpoint");
    std::this_thread::sleep_for(std::chrono::milliseconds(1 + attempt % 10));
  }
}

int32_t DaysSince1970At(double t) {
  const time_t secs = static_cast<time_t>(std::floor(t));
  struct tm tm;
  localtime_r(&secs, &tm);
  // From the local civil date, so the answer follows the local calendar
  // whatever the zone's offset or daylight saving.
  return static_cast<int32_t>(DaysFromCivil(tm.tm_year + 1900, static_cast<unsigned>(tm.tm_mon + 1),
                                            static_cast<unsigned>(tm.tm_mday)));
}

double StartOfDay(int32_t day) {
  int64_t y = 0;
  unsigned m = 0, d = 0;
  CivilFromDays(day, &y, &m, &d);
  struct tm tm = {};
  tm.tm_year = static_cast<int>(y - 1900);
  tm.tm_mon = static_cast<int>(m) - 1;
  tm.tm_mday = static_cast<int>(d);
  tm.tm_isdst = -1;
  // Where a zone skips midnight, mktime lands on the first instant of the day.
  return static_cast<double>(mktime(&tm));
}

}  // namespace platform

using platform::Context;

namespace {

int32_t Today() { return platform::DaysSince1970At(platform::Now()); }

template <typename F>
bool WithStore(const char* what, F&& f) {
  // Held through a whole batch too, so that another thread's write never
  // lands inside this thread's transaction.
  std::lock_guard<std::recursive_mutex> lock(platform::SharedStateMutex());
  platform::TallyStore* store = Context::Current().store();
  if (!store) return false;
  if (!f(*store)) {
    platform::LogError("Tallybook %s failed: %s", what, store->last_error());
    return false;
  }
  return true;
}

}  // namespace

int32_t TBDaysSince1970() { return Today(); }

bool TBClientSetValueForScalarKey(std::string_view key, int64_t value) {
  return WithStore("set", [&](platform::TallyStore& s) { return s.SetScalar(Today(), key, value); });
}

bool TBClientAddValueForScalarKey(std::string_view key, int64_t value) {
  return WithStore("add", [&](platform::TallyStore& s) { return s.AddScalar(Today(), key, value); });
}

bool TBClientPushValueForDistributionKey(std::string_view key, double value, int32_t secondsInDayOffset) {
  return WithStore("push",
                   [&](platform::TallyStore& s) { return s.PushSample(Today(), key, value, secondsInDayOffset); });
}

bool TBClientWriteInOneTransaction(const std::function<void()>& body) {
  // Each write inside still reports its own failure; the batch commits
  // whatever succeeded, as separate writes would have.
  return WithStore("batch", [&](platform::TallyStore& s) {
    return s.Batch([&] {
      body();
      return true;
    });
  });
}

bool TBClientCheckpoint() {
  return WithStore("checkpoint", [](platform::TallyStore& s) { return s.Checkpoint(); });
}

cf::Date dateForDaysSince1970(int32_t day) { return cf::Date{platform::StartOfDay(day)}; }
