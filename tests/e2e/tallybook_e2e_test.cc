#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "../temp_dir.h"
#include "platform/device_root.h"
#include "platform/files.h"
#include "platform/store.h"
#include "run.h"

namespace {

const std::string kStore = "var/mobile/Library/Tallybook/TBDataStore.sqlitedb";

class TallybookTest : public ::testing::Test {
 protected:
  // A bare root: the marker alone, the store made by the first write.
  void SetUp() override { ASSERT_TRUE(platform::WriteRootMarker(root.path(), nullptr)); }
  TempDir root;
  // 2026-11-22 10:00 UTC is day 20779.
  std::map<std::string, std::string> env{
      {"TALLYRUN_ROOT", root.path()}, {"TALLYRUN_NOW", "2026-11-22T10:00:00Z"}, {"TZ", "UTC0"}};

  RunResult Tallybook(const std::vector<std::string>& args) { return RunProgram(TALLYBOOK_BIN, args, env); }
};

TEST_F(TallybookTest, WritesAndDumpsToday) {
  EXPECT_EQ(Tallybook({"today"}).out, "20779\n");
  EXPECT_EQ(Tallybook({"set", "com.velmora.a", "-9223372036854775808"}).status, 0);
  EXPECT_EQ(Tallybook({"add", "com.velmora.b", "5"}).status, 0);
  EXPECT_EQ(Tallybook({"add", "com.velmora.b", "-2"}).status, 0);
  EXPECT_EQ(Tallybook({"push", "com.velmora.lat", "1.5", "--offset", "60"}).status, 0);
  EXPECT_EQ(Tallybook({"push", "com.velmora.lat", "2.5"}).status, 0);  // offset from the clock
  EXPECT_EQ(Tallybook({"push", "other.lat", "-1"}).status, 0);
  env["TALLYRUN_NOW"] = "2026-11-23T00:00:00Z";
  EXPECT_EQ(Tallybook({"set", "com.velmora.a", "1"}).status, 0);

  const RunResult all = Tallybook({"dump"});
  EXPECT_EQ(all.status, 0) << all.err;
  EXPECT_EQ(all.out,
            "20779 com.velmora.a -9223372036854775808\n"
            "20779 com.velmora.b 3\n"
            "20780 com.velmora.a 1\n"
            "20779 com.velmora.lat 2 1.5 2.5 2\n"
            "20779 other.lat 1 -1 -1 -1\n");
  EXPECT_EQ(Tallybook({"dump", "--day", "20779", "--prefix", "com.velmora.l"}).out, "20779 com.velmora.lat 2 1.5 2.5 2\n");
  EXPECT_EQ(Tallybook({"dump", "--day", "20780"}).out, "20780 com.velmora.a 1\n");
}

TEST_F(TallybookTest, BadInputExitsTwoAndLeavesTheStoreAlone) {
  const std::vector<std::vector<std::string>> bad = {
      {"set", "", "1"},
      {"set", "k", "1.5"},
      {"set", "k", "9223372036854775808"},
      {"set", "k", "-9223372036854775809"},
      {"add", "k", "twelve"},
      {"add", "k", ""},
      {"push", "k", "nan"},
      {"push", "k", "1e999"},
      {"push", "k", "1", "--offset", "-1"},
      {"push", "k", "1", "--offset", "abc"},
      {"frobnicate"},
      {},
      {"set", "k"},
      {"dump", "--day", "99999999999"},
      // Keys the day's log could not carry.
      {"set", "com.x.bad\x01key", "5"},
      {"add", "com.x.\xff", "1"},
      {"push", "com.x.\xef\xbf\xbf", "1"},
  };
  for (const auto& args : bad) {
    const RunResult r = Tallybook(args);
    std::string joined;
    for (const auto& a : args) joined += a + " ";
    EXPECT_EQ(r.status, 2) << joined;
    EXPECT_FALSE(r.err.empty()) << joined;
    EXPECT_FALSE(platform::FileExists(root / kStore)) << joined;
  }
  EXPECT_EQ(Tallybook({"set", "k", "x"}).err, "tallybook: value is not a signed 64-bit integer: \"x\"\n");
  EXPECT_EQ(Tallybook({"add", "", "1"}).err, "tallybook: key must not be empty\n");
  EXPECT_EQ(Tallybook({"set", "com.x.bad\x01key", "5"}).err,
            "tallybook: key cannot be stored, a property list cannot carry it: control character U+0001 at byte 9\n");

  // A file that is not a store: clear message, status 1, file untouched.
  ASSERT_TRUE(platform::WriteFileAtomically(root / kStore, "plain text, not a database"));
  const RunResult r = Tallybook({"add", "k", "1"});
  EXPECT_EQ(r.status, 1);
  EXPECT_NE(r.err.find("is not a Tallybook store"), std::string::npos) << r.err;
  EXPECT_EQ(*platform::ReadFile(root / kStore), "plain text, not a database");
  EXPECT_EQ(Tallybook({"dump"}).status, 1);
}

TEST_F(TallybookTest, ValuesAtTheEdgesOfTheRange) {
  EXPECT_EQ(Tallybook({"set", "com.velmora.max", "9223372036854775807"}).status, 0);
  EXPECT_EQ(Tallybook({"set", "com.velmora.min", "-9223372036854775808"}).status, 0);
  EXPECT_EQ(Tallybook({"set", "com.velmora.near", "9223372036854775806"}).status, 0);
  EXPECT_EQ(Tallybook({"add", "com.velmora.near", "1"}).status, 0);
  const std::string before = Tallybook({"dump"}).out;
  EXPECT_EQ(before,
            "20779 com.velmora.max 9223372036854775807\n"
            "20779 com.velmora.min -9223372036854775808\n"
            "20779 com.velmora.near 9223372036854775807\n");

  // One past either end is refused, and the value stays an integer.
  RunResult r = Tallybook({"add", "com.velmora.max", "1"});
  EXPECT_EQ(r.status, 2);
  EXPECT_EQ(r.err,
            "tallybook: adding 1 to com.velmora.max would take its value past the signed 64-bit range\n");
  r = Tallybook({"add", "com.velmora.min", "-1"});
  EXPECT_EQ(r.status, 2);
  EXPECT_EQ(r.err,
            "tallybook: adding -1 to com.velmora.min would take its value past the signed 64-bit range\n");
  EXPECT_EQ(Tallybook({"add", "com.velmora.near", "9223372036854775807"}).status, 2);
  EXPECT_EQ(Tallybook({"set", "com.velmora.max", "9223372036854775808"}).status, 2);
  EXPECT_EQ(Tallybook({"dump"}).out, before);
  EXPECT_EQ(Tallybook({"add", "com.velmora.max", "-9223372036854775808"}).status, 0);
  EXPECT_EQ(Tallybook({"dump", "--prefix", "com.velmora.max"}).out, "20779 com.velmora.max -1\n");
}

TEST_F(TallybookTest, AMissingOrUnreadableRootIsAnError) {
  const std::string typo = root / "no/such/root";
  const std::string how = "; make one with: devsim init " + typo + " (and set TALLYRUN_ROOT=" + typo + ")\n";
  env["TALLYRUN_ROOT"] = typo;
  for (const auto& args : std::vector<std::vector<std::string>>{{"set", "k", "1"}, {"push", "k", "1"}, {"dump"}}) {
    const RunResult r = Tallybook(args);
    EXPECT_EQ(r.status, 1) << args[0];
    EXPECT_EQ(r.err, "tallybook: no device root at " + typo + how);
  }
  EXPECT_FALSE(platform::FileExists(root / "no"));
  const RunResult ctl = RunProgram(TALLYCTL_BIN, {"logging-status"}, env);
  EXPECT_EQ(ctl.status, 1);
  EXPECT_EQ(ctl.err, "tallyctl: no device root at " + typo + how);
  ASSERT_TRUE(platform::WriteFileAtomically(root / "file", "x"));
  env["TALLYRUN_ROOT"] = root / "file";
  EXPECT_EQ(Tallybook({"set", "k", "1"}).err, "tallybook: the device root " + (root / "file") + " is not a directory\n");
  EXPECT_EQ(Tallybook({"today"}).status, 0);  // needs no root

  // A directory that devsim did not make, and "/", are never roots: nothing
  // is written into them.
  const std::string plain = root / "plain";
  ASSERT_TRUE(platform::WriteFileAtomically(plain + "/notes.txt", "mine"));
  env["TALLYRUN_ROOT"] = plain;
  RunResult r = Tallybook({"set", "k", "1"});
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.err, "tallybook: " + plain + " is not a device root (it has no .tallyrun-root and no store); make one "
                   "with: devsim init " + plain + " (and set TALLYRUN_ROOT=" + plain + ")\n");
  for (const char* look : {"controller", "views", "ioreport"}) {
    r = RunProgram(DEVSIM_BIN, {look, plain}, env);
    EXPECT_EQ(r.status, 1) << look;
    EXPECT_EQ(r.err.rfind("devsim: " + plain + " is not a device root (it has no .tallyrun-root and no store)", 0), 0u)
        << r.err;
  }
  EXPECT_FALSE(platform::FileExists(plain + "/var"));
  env["TALLYRUN_ROOT"] = "/";
  r = Tallybook({"dump"});
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.err, "tallybook: / is never a device root; make one with: devsim init DIR (and set TALLYRUN_ROOT=DIR)\n");

  // A root locked against everyone, the superuser included.
  namespace fs = std::filesystem;
  env["TALLYRUN_ROOT"] = root.path();
  fs::permissions(root.path(), fs::perms::none);
  r = Tallybook({"set", "k", "3"});
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.err, "tallybook: cannot read the device root " + root.path() + ": Permission denied\n");
  r = RunProgram(TALLYCTL_BIN, {"logging-status"}, env);
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.err, "tallyctl: cannot read the device root " + root.path() + ": Permission denied\n");
  fs::permissions(root.path(), fs::perms::owner_all);
  EXPECT_FALSE(platform::FileExists(root / "var"));
}

TEST_F(TallybookTest, ARootOrStoreOutOfReachSaysWhy) {
  if (geteuid() == 0) GTEST_SKIP() << "running as root: file permissions do not apply, so nothing is out of reach";
  namespace fs = std::filesystem;
  {
    // Closed as the daily job closes it: no log files are left beside it.
    auto store = platform::TallyStore::Open(root / kStore, platform::TallyStore::Mode::kCreate, nullptr);
    ASSERT_TRUE(store && store->SetScalar(20779, "k", 1));
  }
  const std::string dir = root / "var/mobile/Library/Tallybook";
  fs::permissions(dir, fs::perms::owner_read | fs::perms::owner_exec);
  RunResult r = Tallybook({"set", "k", "2"});
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.err, "tallybook: cannot open store " + (root / kStore) + ": its directory " + dir +
                       " is not writable (permission denied), and the store keeps its write-ahead log beside it\n");
  fs::permissions(dir, fs::perms::owner_all);

  // Readable only by its owner: another user may not use it.
  fs::permissions(root.path(), fs::perms::owner_write | fs::perms::owner_exec | fs::perms::group_read |
                                   fs::perms::group_exec | fs::perms::others_read | fs::perms::others_exec);
  r = Tallybook({"set", "k", "3"});
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.err, "tallybook: cannot read the device root " + root.path() + ": Permission denied\n");
  fs::permissions(root.path(), fs::perms::owner_all);
  EXPECT_EQ(Tallybook({"dump"}).out, "20779 k 1\n");
}

TEST_F(TallybookTest, ParallelProcessesAddExactly) {
  constexpr int kProcesses = 4, kEach = 15;
  std::vector<pid_t> pids;
  for (int p = 0; p < kProcesses; ++p) {
    const pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      for (int i = 0; i < kEach; ++i)
        if (RunProgram(TALLYBOOK_BIN, {"add", "com.velmora.hits", "3"}, env).status != 0) _exit(1);
      _exit(0);
    }
    pids.push_back(pid);
  }
  for (pid_t pid : pids) {
    int status = 0;
    waitpid(pid, &status, 0);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  }
  EXPECT_EQ(Tallybook({"dump"}).out, "20779 com.velmora.hits " + std::to_string(kProcesses * kEach * 3) + "\n");
}

}  // namespace
