#include "platform/store.h"

#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstdint>
#include <filesystem>
#include <thread>
#include <vector>

#include "../../tests/store_pages.h"
#include "../../tests/temp_dir.h"
#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/history.h"
#include "platform/log.h"
#include "platform/prefs.h"

namespace platform {
namespace {

struct Row {
  int32_t day;
  std::string key;
  int64_t value;
  bool operator==(const Row& o) const { return day == o.day && key == o.key && value == o.value; }
};

std::vector<Row> Scalars(TBHistory& h, std::string_view prefix, int32_t lo, int32_t hi) {
  std::vector<Row> rows;
  EXPECT_TRUE(h.scalarsForKeyPrefix(prefix, lo, hi, [&](const std::string& k, int32_t d, int64_t v, bool*) {
    rows.push_back({d, k, v});
  }));
  return rows;
}

TEST(StoreTest, ConcurrentWritersLoseNothing) {
  TempDir dir;
  const std::string path = dir / "TBDataStore.sqlitedb";
  constexpr int kWriters = 6, kAdds = 150;
  std::vector<pid_t> children;
  for (int w = 0; w < kWriters; ++w) {
    const pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      // Each writer is its own process with its own connection, and the
      // first ones race to create the schema.
      std::string error;
      auto store = TallyStore::Open(path, TallyStore::Mode::kCreate, &error);
      if (!store) {
        fprintf(stderr, "open: %s\n", error.c_str());
        _exit(10);
      }
      for (int i = 1; i <= kAdds; ++i) {
        if (!store->AddScalar(100, "com.velmora.test.sum", i)) _exit(11);
        if (i % 10 == 0 && !store->PushSample(100, "com.velmora.test.dist", w, i)) _exit(12);
      }
      _exit(0);
    }
    children.push_back(pid);
  }
  for (pid_t pid : children) {
    int status = 0;
    waitpid(pid, &status, 0);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0);
  }
  auto history = TBHistory::initWithPath(path);
  ASSERT_NE(history, nullptr);
  const auto rows = Scalars(*history, "", 99, 100);
  ASSERT_EQ(rows.size(), 1u);
  EXPECT_EQ(rows[0].value, int64_t{kWriters} * kAdds * (kAdds + 1) / 2);
  size_t samples = 0;
  history->distributionsForKeyPrefix("", 99, 100, [&](const std::string&, int32_t, TBHistoryDistributionEnumerator& e, bool*) {
    while (e.getNextValue(nullptr, nullptr)) ++samples;
  });
  EXPECT_EQ(samples, size_t{kWriters} * kAdds / 10);
}

TEST(StoreTest, HistoryStreamsInDayKeyOrderWithPrefixAndRange) {
  TempDir dir;
  const std::string path = dir / "s.sqlitedb";
  auto store = TallyStore::Open(path, TallyStore::Mode::kCreate, nullptr);
  ASSERT_NE(store, nullptr);
  ASSERT_TRUE(store->SetScalar(11, "b.two", 2));
  ASSERT_TRUE(store->SetScalar(10, "b.one", 1));
  ASSERT_TRUE(store->SetScalar(11, "a.x", -5));
  ASSERT_TRUE(store->SetScalar(12, "a.y", 9));
  ASSERT_TRUE(store->SetScalar(11, "b.two", 20));  // set replaces
  ASSERT_TRUE(store->AddScalar(11, "b.three", 3));
  ASSERT_TRUE(store->AddScalar(11, "b.three", -4));  // add adds
  ASSERT_TRUE(store->SetScalar(11, "b", 7));          // the prefix itself matches
  ASSERT_TRUE(store->SetScalar(11, "c_", 8));         // LIKE wildcards mean nothing
  ASSERT_TRUE(store->SetScalar(11, "cX", 9));

  auto history = TBHistory::initWithPath(path);
  ASSERT_NE(history, nullptr);
  EXPECT_EQ(Scalars(*history, "", 9, 11),
            (std::vector<Row>{{10, "b.one", 1}, {11, "a.x", -5}, {11, "b", 7}, {11, "b.three", -1},
                              {11, "b.two", 20}, {11, "cX", 9}, {11, "c_", 8}}));
  // The minimum is excluded, the maximum included: (10, 11] is day 11 alone.
  EXPECT_EQ(Scalars(*history, "b", 10, 11), (std::vector<Row>{{11, "b", 7}, {11, "b.three", -1}, {11, "b.two", 20}}));
  EXPECT_EQ(Scalars(*history, "", 11, 12), (std::vector<Row>{{12, "a.y", 9}}));
  EXPECT_TRUE(Scalars(*history, "", 12, 12).empty());
  EXPECT_EQ(Scalars(*history, "c_", 0, 100), (std::vector<Row>{{11, "c_", 8}}));
  EXPECT_TRUE(Scalars(*history, "", 13, 20).empty());
  EXPECT_TRUE(Scalars(*history, "", 12, 11).empty());

  int seen = 0;
  history->scalarsForKeyPrefix("", 0, 100, [&](const std::string&, int32_t, int64_t, bool* stop) {
    if (++seen == 2) *stop = true;
  });
  EXPECT_EQ(seen, 2);

  // Samples come back in push order with their offsets, one row per key and day.
  ASSERT_TRUE(store->PushSample(11, "d.lat", 3.5, 100));
  ASSERT_TRUE(store->PushSamples(11, "d.lat", {{-1.25, 7}, {1e300, 86399}}));
  ASSERT_TRUE(store->PushSample(10, "d.lat", 42, 0));
  ASSERT_TRUE(store->PushSample(11, "d.a", 0, 5));
  std::vector<std::string> order;
  std::vector<std::pair<double, int32_t>> lat11;
  ASSERT_TRUE(history->distributionsForKeyPrefix(
      "d.", 9, 11, [&](const std::string& key, int32_t day, TBHistoryDistributionEnumerator& e, bool*) {
        order.push_back(std::to_string(day) + " " + key);
        double v;
        int32_t off;
        while (e.getNextValue(&v, &off))
          if (day == 11 && key == "d.lat") lat11.emplace_back(v, off);
        EXPECT_FALSE(e.getNextValue(&v, &off));  // stays exhausted
      }));
  EXPECT_EQ(order, (std::vector<std::string>{"10 d.lat", "11 d.a", "11 d.lat"}));
  EXPECT_EQ(lat11, (std::vector<std::pair<double, int32_t>>{{3.5, 100}, {-1.25, 7}, {1e300, 86399}}));
  EXPECT_TRUE(store->Checkpoint());
}

TEST(StoreTest, AHistoryCallSeesOneConsistentView) {
  TempDir dir;
  const std::string path = dir / "s.sqlitedb";
  auto store = TallyStore::Open(path, TallyStore::Mode::kCreate, nullptr);
  ASSERT_TRUE(store->PushSamples(5, "k", {{1, 0}, {2, 0}}));
  ASSERT_TRUE(store->SetScalar(5, "s", 1));
  auto history = TBHistory::initWithPath(path);
  int count = 0;
  ASSERT_TRUE(history->distributionsForKeyPrefix("", 4, 5, [&](const std::string&, int32_t, TBHistoryDistributionEnumerator& e, bool*) {
    // A writer commits while the reader is half-way: the reader keeps its view.
    ASSERT_TRUE(e.getNextValue(nullptr, nullptr));
    ++count;
    auto writer = TallyStore::Open(path, TallyStore::Mode::kCreate, nullptr);
    ASSERT_TRUE(writer->PushSamples(5, "k", {{3, 0}, {4, 0}}));
    ASSERT_TRUE(writer->PushSample(5, "later", 1, 0));
    while (e.getNextValue(nullptr, nullptr)) ++count;
  }));
  EXPECT_EQ(count, 2);
  // The next call sees the new rows.
  int keys = 0;
  history->distributionsForKeyPrefix("", 4, 5, [&](const std::string&, int32_t, TBHistoryDistributionEnumerator&, bool*) { ++keys; });
  EXPECT_EQ(keys, 2);
}

TEST(StoreTest, ForeignFilesAreRefusedAndLeftUntouched) {
  TempDir dir;
  const std::string text = dir / "text.sqlitedb";
  const std::string content(5000, 'x');
  ASSERT_TRUE(WriteFileAtomically(text, content));
  std::string error;
  EXPECT_EQ(TallyStore::Open(text, TallyStore::Mode::kCreate, &error), nullptr);
  EXPECT_NE(error.find("is not a Tallybook store"), std::string::npos) << error;
  EXPECT_EQ(*ReadFile(text), content);
  EXPECT_EQ(TBHistory::initWithPath(text, &error), nullptr);
  EXPECT_EQ(*ReadFile(text), content);

  // Another program's SQLite database.
  const std::string other = dir / "other.sqlitedb";
  {
    sqlite3* db = nullptr;
    sqlite3_open(other.c_str(), &db);
    sqlite3_exec(db, "CREATE TABLE notes(x)", nullptr, nullptr, nullptr);
    sqlite3_close(db);
  }
  EXPECT_EQ(TallyStore::Open(other, TallyStore::Mode::kCreate, &error), nullptr);
  EXPECT_EQ(error, other + " is an SQLite database but not a Tallybook store");

  // A store written by a newer program.
  const std::string newer = dir / "newer.sqlitedb";
  ASSERT_NE(TallyStore::Open(newer, TallyStore::Mode::kCreate, nullptr), nullptr);
  {
    sqlite3* db = nullptr;
    sqlite3_open(newer.c_str(), &db);
    sqlite3_exec(db, "PRAGMA user_version=7", nullptr, nullptr, nullptr);
    sqlite3_close(db);
  }
  EXPECT_EQ(TallyStore::Open(newer, TallyStore::Mode::kCreate, &error), nullptr);
  EXPECT_EQ(error, newer + " has store schema version 7, newer than this program understands (1)");

  EXPECT_EQ(TBHistory::initWithPath(dir / "missing.sqlitedb", &error), nullptr);
  EXPECT_FALSE(FileExists(dir / "missing.sqlitedb"));
}

TEST(StoreTest, ClientCallsWriteTodayUnderTheRoot) {
  TempDir root;
  auto clock = std::make_shared<FixedClock>(86400.0 * 20000 + 3600);
  auto log = std::make_shared<CaptureLog>();
  setenv("TZ", "UTC0", 1);
  tzset();
  ContextScope scope(root.path(), Backends{clock, log});
  ASSERT_TRUE(TBClientSetValueForScalarKey("com.velmora.x", 5));
  ASSERT_TRUE(TBClientAddValueForScalarKey("com.velmora.x", 6));
  ASSERT_TRUE(TBClientPushValueForDistributionKey("com.velmora.d", 0.5, 3600));
  ASSERT_TRUE(TBClientCheckpoint());
  auto history = TBHistory::initWithDefaultPath();
  ASSERT_NE(history, nullptr);
  EXPECT_EQ(Scalars(*history, "", 19999, 20000), (std::vector<Row>{{20000, "com.velmora.x", 11}}));
  EXPECT_TRUE(FileExists(root / "var/mobile/Library/Tallybook/TBDataStore.sqlitedb"));

  // A broken store: the client answers false with one error line, and never writes.
  TempDir bad;
  ASSERT_TRUE(WriteFileAtomically(bad / "var/mobile/Library/Tallybook/TBDataStore.sqlitedb", "garbage"));
  ContextScope broken(bad.path(), Backends{clock, log});
  EXPECT_FALSE(TBClientSetValueForScalarKey("k", 1));
  EXPECT_FALSE(TBClientCheckpoint());
  EXPECT_EQ(log->CountContaining("Tallybook store unavailable"), 1u);
  EXPECT_EQ(*ReadFile(bad / "var/mobile/Library/Tallybook/TBDataStore.sqlitedb"), "garbage");
}

// The stored value and its SQLite type, straight from the table.
std::string Stored(TallyStore& store, int32_t day, const std::string& key) {
  sqlite3_stmt* st = nullptr;
  sqlite3_prepare_v2(store.handle(), "SELECT typeof(value), value FROM scalars WHERE day = ?1 AND key = ?2", -1, &st,
                     nullptr);
  sqlite3_bind_int(st, 1, day);
  sqlite3_bind_text(st, 2, key.c_str(), -1, SQLITE_TRANSIENT);
  std::string out = "none";
  if (sqlite3_step(st) == SQLITE_ROW)
    out = std::string(reinterpret_cast<const char*>(sqlite3_column_text(st, 0))) + " " +
          reinterpret_cast<const char*>(sqlite3_column_text(st, 1));
  sqlite3_finalize(st);
  return out;
}

TEST(StoreTest, WritesRefuseKeysALogCannotCarry) {
  TempDir root;
  auto log = std::make_shared<CaptureLog>();
  ContextScope scope(root.path(), Backends{std::make_shared<FixedClock>(86400.0 * 20000), log});
  TallyStore& store = *Context::Current().store();
  const std::string bad_keys[] = {"com.x.bad\x01key", "com.x.\xff", "com.x.\xef\xbf\xbe", std::string("nul\0", 4)};
  for (const std::string& key : bad_keys) {
    EXPECT_FALSE(store.SetScalar(1, key, 1));
    EXPECT_TRUE(store.last_error_is_bad_input());
    EXPECT_FALSE(store.AddScalar(1, key, 1));
    EXPECT_FALSE(store.PushSample(1, key, 1, 0));
    EXPECT_FALSE(store.PushSamples(1, key, {{1, 0}, {2, 0}}));
    EXPECT_FALSE(TBClientSetValueForScalarKey(key, 1));
    EXPECT_FALSE(TBClientAddValueForScalarKey(key, 1));
    EXPECT_FALSE(TBClientPushValueForDistributionKey(key, 1, 0));
  }
  EXPECT_EQ(store.last_error(), "key cannot be stored, a property list cannot carry it: control character U+0000 at byte 3");
  EXPECT_EQ(log->Count("Tallybook set failed: key cannot be stored, a property list cannot carry it: control "
                       "character U+0001 at byte 9"),
            1u);
  EXPECT_EQ(log->CountContaining("Tallybook push failed: key cannot be stored"), 4u);
  auto history = TBHistory::initWithDefaultPath();
  ASSERT_NE(history, nullptr);
  EXPECT_TRUE(Scalars(*history, "", INT32_MIN, INT32_MAX).empty());
  int series = 0;
  history->distributionsForKeyPrefix("", INT32_MIN, INT32_MAX,
                                     [&](const std::string&, int32_t, TBHistoryDistributionEnumerator&, bool*) { ++series; });
  EXPECT_EQ(series, 0);
}

TEST(StoreTest, AddingPastTheRangeIsRefused) {
  TempDir root;
  auto log = std::make_shared<CaptureLog>();
  ContextScope scope(root.path(), Backends{std::make_shared<FixedClock>(86400.0 * 20000), log});
  TallyStore& store = *Context::Current().store();
  // Sums at both ends of the range: one past is refused and leaves an
  // integer behind, never a real.
  struct Sum {
    int64_t start, add;
    bool ok;
    int64_t end;
  };
  const Sum sums[] = {
      {INT64_MAX - 1, 1, true, INT64_MAX}, {INT64_MAX, 1, false, INT64_MAX}, {INT64_MAX, INT64_MIN, true, -1},
      {1, INT64_MAX, false, 1},            {INT64_MIN + 1, -1, true, INT64_MIN}, {INT64_MIN, -1, false, INT64_MIN},
      {-1, INT64_MIN, false, -1},          {0, INT64_MIN, true, INT64_MIN},      {INT64_MIN, INT64_MAX, true, -1},
  };
  for (size_t i = 0; i < std::size(sums); ++i) {
    const std::string key = "sum." + std::to_string(i);
    ASSERT_TRUE(store.SetScalar(2, key, sums[i].start));
    EXPECT_EQ(store.AddScalar(2, key, sums[i].add), sums[i].ok) << key;
    EXPECT_TRUE(sums[i].ok || store.last_error_is_bad_input()) << key;
    EXPECT_EQ(Stored(store, 2, key), "integer " + std::to_string(sums[i].end)) << key;
  }
  EXPECT_EQ(store.last_error(), "adding -9223372036854775808 to sum.6 would take its value past the signed 64-bit range");
  EXPECT_TRUE(store.AddScalar(2, "sum.new", INT64_MIN));  // a new row takes any value
  EXPECT_EQ(Stored(store, 2, "sum.new"), "integer -9223372036854775808");
  ASSERT_TRUE(TBClientSetValueForScalarKey("sum.client", INT64_MAX));
  EXPECT_FALSE(TBClientAddValueForScalarKey("sum.client", 1));
  EXPECT_EQ(log->Count("Tallybook add failed: adding 1 to sum.client would take its value past the signed 64-bit "
                       "range"),
            1u);
}

TEST(StoreTest, CheckpointWaitsForAnotherConnectionsCheckpoint) {
  TempDir dir;
  const std::string path = dir / "s.sqlitedb";
  auto store = TallyStore::Open(path, TallyStore::Mode::kCreate, nullptr);
  ASSERT_NE(store, nullptr);
  ASSERT_TRUE(store->SetScalar(1, "k", 1));

  // A writer holds the write lock; a second connection starts a full
  // checkpoint, which takes the checkpoint lock and then waits for the
  // writer. Our checkpoint meets that lock.
  sqlite3* writer = nullptr;
  sqlite3* checkpointer = nullptr;
  ASSERT_EQ(sqlite3_open(path.c_str(), &writer), SQLITE_OK);
  ASSERT_EQ(sqlite3_open(path.c_str(), &checkpointer), SQLITE_OK);
  // A connection joins the write-ahead log only once it has read.
  ASSERT_EQ(sqlite3_exec(checkpointer, "SELECT count(*) FROM scalars", nullptr, nullptr, nullptr), SQLITE_OK);
  ASSERT_EQ(sqlite3_exec(writer, "BEGIN IMMEDIATE; INSERT INTO scalars VALUES(1, 'w', 1)", nullptr, nullptr, nullptr),
            SQLITE_OK);
  std::atomic<bool> waiting{false}, release{false};
  sqlite3_busy_handler(
      checkpointer,
      [](void* flag, int) {
        static_cast<std::atomic<bool>*>(flag)->store(true);
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
        return 1;
      },
      &waiting);
  int checkpointer_rc = -1;
  std::thread full([&] {
    checkpointer_rc = sqlite3_wal_checkpoint_v2(checkpointer, nullptr, SQLITE_CHECKPOINT_FULL, nullptr, nullptr);
  });
  std::thread commit([&] {
    while (!release) std::this_thread::sleep_for(std::chrono::milliseconds(1));
    std::this_thread::sleep_for(std::chrono::milliseconds(300));  // while our checkpoint is under way
    sqlite3_exec(writer, "COMMIT", nullptr, nullptr, nullptr);
  });
  for (int i = 0; i < 10000 && !waiting; ++i) std::this_thread::sleep_for(std::chrono::milliseconds(1));
  EXPECT_TRUE(waiting) << "the other checkpoint never waited for the writer";
  release = true;
  EXPECT_TRUE(store->Checkpoint()) << store->last_error();
  commit.join();
  full.join();
  EXPECT_EQ(checkpointer_rc, SQLITE_OK);
  sqlite3_close(writer);
  sqlite3_close(checkpointer);
}

TEST(StoreTest, ACorruptPageIsAReadErrorAndIsCounted) {
  TempDir root;
  auto log = std::make_shared<CaptureLog>();
  ContextScope scope(root.path(), Backends{std::make_shared<FixedClock>(86400.0 * 20000), log});
  const std::string path = Context::Current().Path(kStoreDevicePath);
  constexpr int kKeys = 3000, kSeries = 300, kSamples = 40;
  {
    auto store = TallyStore::Open(path, TallyStore::Mode::kCreate, nullptr);
    ASSERT_NE(store, nullptr);
    ASSERT_TRUE(store->Batch([&] {
      bool ok = true;
      for (int i = 0; i < kKeys; ++i) ok = ok && store->SetScalar(11, "com.velmora.k" + std::to_string(10000 + i), i);
      std::vector<std::pair<double, int32_t>> samples(kSamples, {1.5, 60});
      for (int i = 0; i < kSeries; ++i) ok = ok && store->PushSamples(11, "com.velmora.d" + std::to_string(i), samples);
      return ok;
    }));
  }  // the last connection folds the log into the file
  int64_t page_size = 0;
  const std::vector<int64_t> scalar_leaves = LeafPages(path, "scalars", &page_size);
  const std::vector<int64_t> sample_leaves = LeafPages(path, "samples", &page_size);
  ASSERT_GT(scalar_leaves.size(), 4u);
  ASSERT_GT(sample_leaves.size(), 4u);
  ASSERT_TRUE(OverwritePage(path, scalar_leaves[scalar_leaves.size() / 2], page_size));

  auto history = TBHistory::initWithDefaultPath();
  ASSERT_NE(history, nullptr);
  int rows = 0;
  EXPECT_FALSE(history->scalarsForKeyPrefix("", 10, 11, [&](const std::string&, int32_t, int64_t, bool*) { ++rows; }));
  EXPECT_GT(rows, 0);
  EXPECT_LT(rows, kKeys);
  EXPECT_EQ(log->Count("Tallybook history read failed: database disk image is malformed"), 1u);
  EXPECT_EQ(DGVPreferencesGetIntegerValue(kStoreCorruptionKey, kStoreCorruptionDomain), 1);

  // Samples cut short by a bad page are a failure too, not a shorter day.
  ASSERT_TRUE(OverwritePage(path, sample_leaves[sample_leaves.size() / 2], page_size));
  history = TBHistory::initWithDefaultPath();
  int samples = 0;
  EXPECT_FALSE(history->distributionsForKeyPrefix(
      "", 10, 11, [&](const std::string&, int32_t, TBHistoryDistributionEnumerator& e, bool*) {
        while (e.getNextValue(nullptr, nullptr)) ++samples;
      }));
  EXPECT_LT(samples, kSeries * kSamples);
  EXPECT_EQ(log->Count("Tallybook history read failed: database disk image is malformed"), 2u);
  // Counted on disk at once, where the report's support library reads it.
  const cf::Value on_disk =
      cf::ParsePropertyList(ReadFile(root / "Library/Preferences/com.velmora.tallybookd.plist").value_or("")).value;
  ASSERT_NE(on_disk.AsDictionary(), nullptr);
  EXPECT_EQ(on_disk.AsDictionary()->Get("DatabaseCorruptionCount"), cf::Value::SInt64(2));
}

TEST(StoreTest, AStoreOutOfReachSaysWhy) {
  if (geteuid() == 0) GTEST_SKIP() << "running as root: file permissions do not apply, so nothing is out of reach";
  TempDir dir;
  const std::string path = dir / "ro/s.sqlitedb";
  ASSERT_NE(TallyStore::Open(path, TallyStore::Mode::kCreate, nullptr), nullptr);
  namespace fs = std::filesystem;
  fs::permissions(dir / "ro", fs::perms::owner_read | fs::perms::owner_exec);
  std::string error;
  EXPECT_EQ(TallyStore::Open(path, TallyStore::Mode::kExisting, &error), nullptr);
  EXPECT_EQ(error, "cannot open store " + path + ": its directory " + (dir / "ro") +
                       " is not writable (permission denied), and the store keeps its write-ahead log beside it");
  EXPECT_EQ(TallyStore::Open(dir / "ro/new.sqlitedb", TallyStore::Mode::kCreate, &error), nullptr);
  EXPECT_NE(error.find("is not writable (permission denied)"), std::string::npos) << error;

  fs::permissions(dir / "ro", fs::perms::owner_all);
  fs::permissions(path, fs::perms::none);
  EXPECT_EQ(TallyStore::Open(path, TallyStore::Mode::kExisting, &error), nullptr);
  EXPECT_EQ(error, "cannot open store " + path + ": the file cannot be read and written (permission denied)");
}

}  // namespace
}  // namespace platform
