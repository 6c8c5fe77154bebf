// Every write, fsync, rename and link of a daily run, one at a time: the run
// is killed there, or that call fails with ENOSPC. After each, the root must
// be whole (the store passes its integrity check, every preference file
// parses, every log has its description) and, once a clean run has followed,
// hold no temporary file and have each day submitted once, except where the
// gate's order (its record is written after the tasks, whatever they
// achieved) makes another count unavoidable. `tallybook status` tells each
// faulted run from a good one.
#include <sqlite3.h>

#include <cstdio>

#include "platform/files.h"
#include "root_fixture.h"

namespace {

namespace fs = std::filesystem;

struct Walk {
  size_t points = 0;
  size_t twice = 0;  // submitted again: killed or failed after the log, before the gate record
  size_t lost = 0;   // not submitted: the log's write failed, and the gate moved on regardless
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
  static std::vector<std::string> Logs(const std::string& root) {
    std::vector<std::string> out;
    std::error_code ec;
    for (const auto& e : fs::directory_iterator(root + "/var/diagvault/submissions", ec))
      if (e.path().extension() == ".193") out.push_back(e.path());
    return out;
  }
  static bool GateRecorded(const std::string& root) {
    const cf::Value v = ReadPlist(root + "/Library/Preferences/" + kDomain + ".plist");
    return v.AsDictionary() && v.AsDictionary()->Get(kGate) == cf::Value::SInt32(kToday - 1);
  }

  // What must hold after any run, however it ended.
  static void ExpectWhole(const std::string& root, const std::string& where) {
    SCOPED_TRACE(where);
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
      walk.points = PointsPassed(RunProgram(TALLYRUN_FAULTS_BIN, {mode}, env).err);
    }
    for (size_t n = 1; n <= walk.points; ++n) {
      const std::string where = mode + " " + kind + ":" + std::to_string(n);
      TempDir dir;
      const std::string root = Fresh(dir);
      auto env = Env(root);
      env["TALLYRUN_FAULT"] = kind + ":" + std::to_string(n);
      const RunResult faulted = RunProgram(TALLYRUN_FAULTS_BIN, {mode}, env);
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
      const size_t logs_after_fault = Logs(root).size();
      const bool gate_after_fault = GateRecorded(root);

      const RunResult clean = RunProgram(TALLYRUN_BIN, {mode}, Env(root));
      EXPECT_EQ(clean.status, 0) << where;
      ExpectWhole(root, where + ", after the next run");
      ExpectNoLeftovers(root);
      if (mode != "-d") continue;
      EXPECT_TRUE(GateRecorded(root)) << where;
      const size_t logs = Logs(root).size();
      if (logs == 2 && logs_after_fault == 1 && !gate_after_fault) {
        ++walk.twice;
      } else if (logs == 0 && kind != "crash" && Count(faulted.err, "Failed to write aggregated log") == 1) {
        ++walk.lost;
      } else {
        EXPECT_EQ(logs, 1u) << where << "\n" << faulted.err;
      }
    }
    std::printf("[ walk     ] tallyrun %s, %s at each of %zu points: submitted twice %zu, not submitted %zu\n",
                mode.c_str(), kind.c_str(), walk.points, walk.twice, walk.lost);
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

TEST_F(CrashWalkTest, ForcedRun) {
  for (const char* kind : {"crash", "ENOSPC"}) EXPECT_GT(WalkAll("-f", kind).points, 10u) << kind;
}

}  // namespace
