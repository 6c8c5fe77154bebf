// Every write, fsync, rename and link of a daily run, one at a time: the run
// is killed there, or that call fails with ENOSPC; and whole runs on a disk
// with only so much room left. After each, the root must be whole (the
// store passes its integrity check, every preference file parses, every log
// has its description, every line of a JSON-lines file parses and no line is
// there twice) and, once a clean run has followed, hold no temporary file
// and have the day submitted once by the gated runs: one aggregated log, one
// StorageStatus log. (A log whose write failed is not written later: the
// gate moves on whatever the tasks achieved.) `tallybook status` tells each
// faulted run from a good one.
#include <sqlite3.h>
#include <sys/mount.h>

#include <cstdio>
#include <fstream>
#include <set>

#include "platform/files.h"
#include "root_fixture.h"

namespace {

namespace fs = std::filesystem;

struct Walk {
  size_t points = 0;
  size_t lost = 0;  // not submitted: the log's write failed, and the gate moved on regardless
};

class CrashWalkTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    templ_ = new TempDir;
    const std::string root = templ_->path() + "/root";
    const RunResult init = RunProgram(DEVSIM_BIN, {"init", root}, Env(root));
    ASSERT_EQ(init.status, 0) << init.err;
    // One analytics event in use keeps the event appends in the walk; the
    // storage views' forty more would only multiply the same kind of point.
    std::string enabled;
    ASSERT_TRUE(cf::WriteXMLPropertyList(cf::Array({cf::Value("com.velmora.homedeck.appInstalls")}), enabled, nullptr));
    ASSERT_TRUE(platform::WriteFileAtomically(root + "/var/eventlens/enabled-events.plist", enabled));
  }
  static void TearDownTestSuite() {
    delete templ_;
    templ_ = nullptr;
  }
  static std::map<std::string, std::string> Env(const std::string& root) {
    return {{"TALLYRUN_ROOT", root}, {"TALLYRUN_NOW", "2026-11-22T15:00:00Z"}, {"TZ", "UTC0"},
            {"TALLYRUN_LOG_STDERR", "1"}};
  }
  static std::string Fresh(const TempDir& dir) {
    const std::string root = dir / "root";
    fs::copy(templ_->path() + "/root", root, fs::copy_options::recursive);
    return root;
  }
  static size_t PointsPassed(const std::string& err) {
    const size_t at = err.rfind("fault points passed: ");
    return at == std::string::npos ? 0 : std::stoul(err.substr(at + 21));
  }
  // The submitted logs of a type: 193 aggregated, 165 StorageStatus.
  static std::vector<std::string> Logs(const std::string& root, const char* type = ".193") {
    std::vector<std::string> out;
    std::error_code ec;
    for (const auto& e : fs::directory_iterator(root + "/var/diagvault/submissions", ec))
      if (e.path().extension() == type) out.push_back(e.path());
    return out;
  }
  static bool GateRecorded(const std::string& root) {
    const cf::Value v = ReadPlist(root + "/Library/Preferences/" + kDomain + ".plist");
    return v.AsDictionary() && v.AsDictionary()->Get(kGate) == cf::Value::SInt32(kToday - 1);
  }

  // What must hold after any run, however it ended.
  // (Reading a store whose log is ahead needs room for its index: on a full
  // disk the store is looked at once room is made.)
  static void ExpectWhole(const std::string& root, const std::string& where, bool room = true) {
    SCOPED_TRACE(where);
    if (room) ExpectStoreWhole(root);
    ExpectFilesWhole(root);
  }
  static void ExpectStoreWhole(const std::string& root) {
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open_v2((root + "/var/mobile/Library/Tallybook/TBDataStore.sqlitedb").c_str(), &db,
                              SQLITE_OPEN_READONLY, nullptr),
              SQLITE_OK);
    sqlite3_stmt* st = nullptr;
    ASSERT_EQ(sqlite3_prepare_v2(db, "PRAGMA integrity_check", -1, &st, nullptr), SQLITE_OK);
    ASSERT_EQ(sqlite3_step(st), SQLITE_ROW);
    EXPECT_STREQ(reinterpret_cast<const char*>(sqlite3_column_text(st, 0)), "ok");
    sqlite3_finalize(st);
    sqlite3_close(db);
  }
  static void ExpectFilesWhole(const std::string& root) {
    for (const auto& e : fs::recursive_directory_iterator(root)) {
      const std::string path = e.path();
      if (e.path().extension() == ".plist" && !platform::IsLeftoverTempName(e.path().filename().string())) {
        EXPECT_TRUE(cf::ParsePropertyList(platform::ReadFile(path).value_or("")).ok()) << path;
      }
    }
    for (const std::string& log : Logs(root)) {
      EXPECT_TRUE(cf::ParsePropertyList(platform::ReadFile(log).value_or("")).ok()) << log;
      EXPECT_TRUE(cf::ParseJSON(platform::ReadFile(log + ".json").value_or("")).ok()) << log << " has no description";
    }
    for (const auto& e : fs::recursive_directory_iterator(root)) {
      if (e.path().extension() != ".jsonl") continue;
      const std::string text = platform::ReadFile(e.path()).value_or("");
      EXPECT_TRUE(text.empty() || text.back() == '\n') << e.path() << " ends in a torn line";
      std::set<std::string> ids;
      size_t at = 0;
      for (size_t end; (end = text.find('\n', at)) != std::string::npos; at = end + 1) {
        const cf::ParseResult line = cf::ParseJSON(text.substr(at, end - at));
        ASSERT_TRUE(line.ok() && line.value.AsDictionary()) << e.path() << ": " << text.substr(at, end - at);
        const cf::String* id = line.value.AsDictionary()->Get("id").AsString();
        EXPECT_TRUE(!id || ids.insert(id->str()).second) << e.path() << " holds a line twice: " << text.substr(at, end - at);
      }
    }
  }
  // After the clean run that follows a fault: the day went out once.
  static void ExpectDaySubmittedOnce(const std::string& root, const std::string& where, const RunResult& faulted,
                                     Walk* walk) {
    EXPECT_TRUE(GateRecorded(root)) << where;
    EXPECT_LE(Logs(root, ".165").size(), 1u) << where;
    const size_t logs = Logs(root).size();
    if (logs == 0 && Count(faulted.err, "Failed to write aggregated log") == 1) {
      ++walk->lost;
    } else {
      EXPECT_EQ(logs, 1u) << where << "\n" << faulted.err;
    }
  }
  // The faulted program in a mode: tallyrun with the option, or a service
  // given app information (a gated turn) by tallyctl.
  static RunResult RunFaulted(const std::string& mode, const std::map<std::string, std::string>& env,
                              const std::string& root) {
    if (mode != "service") return RunProgram(TALLYRUN_FAULTS_BIN, {mode}, env);
    const std::string apps = root + "/../apps.json";
    if (!platform::FileExists(apps)) platform::WriteFileAtomically(apps, "[]");
    const char* script =
        "\"$1\" & pid=$!; i=0\n"
        "while [ ! -S \"$TALLYRUN_ROOT/var/run/com.velmora.tallybookd.tallyrun.sock\" ] && [ $i -lt 500 ] &&"
        " kill -0 $pid 2>/dev/null; do sleep 0.01; i=$((i+1)); done\n"
        "\"$2\" logging-status >/dev/null 2>&1; \"$2\" app-data \"$3\" >/dev/null 2>&1\n"
        "wait $pid\n";
    auto service_env = env;
    service_env["TALLYRUN_SERVICE_IDLE_SECONDS"] = "0.3";
    return RunProgram("/bin/sh", {"-c", script, "sh", TALLYRUN_FAULTS_BIN, TALLYCTL_BIN, apps}, service_env);
  }
  static void ExpectNoLeftovers(const std::string& root) {
    for (const auto& e : fs::recursive_directory_iterator(root))
      EXPECT_FALSE(platform::IsLeftoverTempName(e.path().filename().string())) << e.path();
  }

  // Walks every point of one mode with one kind of fault.
  static Walk WalkAll(const std::string& mode, const std::string& kind) {
    Walk walk;
    {
      TempDir dir;
      const std::string root = Fresh(dir);
      auto env = Env(root);
      env["TALLYRUN_FAULT"] = "count:0";
      walk.points = PointsPassed(RunFaulted(mode, env, root).err);
    }
    for (size_t n = 1; n <= walk.points; ++n) {
      const std::string where = mode + " " + kind + ":" + std::to_string(n);
      TempDir dir;
      const std::string root = Fresh(dir);
      auto env = Env(root);
      env["TALLYRUN_FAULT"] = kind + ":" + std::to_string(n);
      const RunResult faulted = RunFaulted(mode, env, root);
      EXPECT_EQ(faulted.status, kind == "crash" ? 128 + SIGKILL : 0) << where << faulted.err;
      ExpectWhole(root, where + ", after the fault");
      // The scheduler hears of it. A kill leaves a run that never ended,
      // unless it came before the run's first record or after its last; a
      // failed write fails the run, unless it was the record's own and the
      // record went over the last one instead.
      const RunResult status = RunProgram(TALLYBOOK_BIN, {"status"}, Env(root));
      if (kind == "crash") {
        EXPECT_TRUE(status.out.rfind("state:    interrupted: ", 0) == 0 ||
                    status.out.rfind("state:    none: ", 0) == 0 || status.out.find("\nended:") != std::string::npos)
            << where << "\n" << status.out;
      } else if (Count(faulted.err, "Recorded how the run went over the last record") == 0) {
        EXPECT_EQ(status.status, 1) << where << "\n" << status.out << faulted.err;
      }
      // The next scheduled run: the gated one, or the same forced run.
      const RunResult clean = RunProgram(TALLYRUN_BIN, {mode == "-f" ? "-f" : "-d"}, Env(root));
      EXPECT_EQ(clean.status, 0) << where;
      ExpectWhole(root, where + ", after the next run");
      ExpectNoLeftovers(root);
      EXPECT_LE(Logs(root, ".165").size(), 1u) << where << " (one StorageStatus log a week)";
      if (mode != "-f") ExpectDaySubmittedOnce(root, where, faulted, &walk);
    }
    std::printf("[ walk     ] tallyrun %s, %s at each of %zu points: not submitted %zu\n", mode.c_str(),
                kind.c_str(), walk.points, walk.lost);
    return walk;
  }

  static TempDir* templ_;
};

TempDir* CrashWalkTest::templ_ = nullptr;

TEST_F(CrashWalkTest, GatedRun) {
  for (const char* kind : {"crash", "ENOSPC"}) {
    const Walk walk = WalkAll("-d", kind);
    EXPECT_GT(walk.points, 15u) << kind;  // the report, its description, preferences and the gate
  }
}

TEST_F(CrashWalkTest, ServiceTurn) {
  const Walk walk = WalkAll("service", "crash");
  EXPECT_GT(walk.points, 15u);
  EXPECT_EQ(walk.lost, 0u);
}

// The root on a file system of its own with only so much room left, from none
// to 256 KiB: gated runs while it is full, then one once room is made.
TEST_F(CrashWalkTest, FullDisk) {
  TempDir dir;
  const std::string mount_point = dir / "fs";
  fs::create_directory(mount_point);
  // Room for the root with its support library (16 MiB in a sanitizer build).
  if (mount("tallyrun-test", mount_point.c_str(), "tmpfs", 0, "size=64m,mode=0700") != 0)
    GTEST_SKIP() << "cannot mount a small file system here (" << std::strerror(errno) << ")";
  struct Unmount {
    std::string at;
    ~Unmount() { umount2(at.c_str(), MNT_DETACH); }
  } unmount{mount_point};
  Walk walk;
  for (int free_kib = 0; free_kib <= 256; free_kib += 16) {
    const std::string where = "full disk, " + std::to_string(free_kib) + " KiB free";
    SCOPED_TRACE(where);
    const std::string root = mount_point + "/root";
    fs::remove_all(root);
    fs::remove(mount_point + "/filler");
    fs::copy(templ_->path() + "/root", root, fs::copy_options::recursive);
    // Fill the file system, then give back what this level leaves free.
    {
      std::ofstream filler(mount_point + "/filler", std::ios::binary);
      const std::string block(1 << 16, '\0');
      while (filler.write(block.data(), block.size())) {
      }
    }
    const uintmax_t full = fs::file_size(mount_point + "/filler");
    fs::resize_file(mount_point + "/filler", full > free_kib * 1024u ? full - free_kib * 1024u : 0);
    RunResult faulted = RunProgram(TALLYRUN_BIN, {"-d"}, Env(root));
    EXPECT_EQ(faulted.status, 0) << faulted.err;
    ExpectWhole(root, where + ", after the first run", false);
    const RunResult again = RunProgram(TALLYRUN_BIN, {"-d"}, Env(root));
    faulted.err += again.err;
    ExpectWhole(root, where + ", after the second run", false);
    fs::remove(mount_point + "/filler");
    const RunResult clean = RunProgram(TALLYRUN_BIN, {"-d"}, Env(root));
    ExpectWhole(root, where + ", after a run with room");
    ExpectNoLeftovers(root);
    ExpectDaySubmittedOnce(root, where, faulted, &walk);
  }
  std::printf("[ walk     ] tallyrun -d on a full disk, 0 to 256 KiB free in 16 KiB steps: not submitted %zu\n",
              walk.lost);
}

TEST_F(CrashWalkTest, ForcedRun) {
  for (const char* kind : {"crash", "ENOSPC"}) EXPECT_GT(WalkAll("-f", kind).points, 10u) << kind;
}

}  // namespace
