// What the job leaves under the root is private to the root's owner, code is
// loaded only when nobody else could have written it, and no write goes
// through a link planted in the root.
#include <grp.h>
#include <pwd.h>
#include <sys/stat.h>

#include "platform/run_record.h"
#include "platform/store.h"
#include "root_fixture.h"

namespace {

namespace fs = std::filesystem;

class PrivacyTest : public RootTest {
 protected:
  struct Entry {
    std::string path;
    mode_t mode;
    gid_t gid;
    bool dir;
  };
  std::vector<Entry> Everything() {
    std::vector<Entry> out;
    struct stat st;
    for (const auto& e : fs::recursive_directory_iterator(root.path())) {
      if (lstat(e.path().c_str(), &st) != 0 || S_ISLNK(st.st_mode)) continue;
      out.push_back({e.path(), st.st_mode & 07777, st.st_gid, S_ISDIR(st.st_mode)});
    }
    return out;
  }
  const std::string library = root / "System/Library/PrivateFrameworks/FaultkeepSupport.framework/FaultkeepSupport";
};

TEST_F(PrivacyTest, EverythingCreatedIsPrivateWhateverTheUmask) {
  // The fixture's devsim ran under the test's umask; run the job under 022.
  const mode_t old = umask(022);
  const RunResult r = Tallyrun({"-f"});
  umask(old);
  ASSERT_EQ(Logs().size(), 1u) << r.err;
  size_t files = 0;
  for (const Entry& e : Everything()) {
    if (e.dir) {
      EXPECT_EQ(e.mode, 0700u) << e.path;
    } else {
      ++files;
      EXPECT_EQ(e.mode, e.path == library ? 0700u : 0600u) << e.path;
    }
  }
  EXPECT_GT(files, 10u);  // the store, its journal, logs, preferences, events ...
  EXPECT_EQ(Count(r.err, "Tightened"), 0u);

  // A root made by an older version is tightened on the next run, a line per path.
  const std::string prefs = root / "Library/Preferences";
  ASSERT_EQ(chmod(prefs.c_str(), 0755), 0);
  ASSERT_EQ(chmod(Logs()[0].c_str(), 0644), 0);
  const RunResult again = Tallyrun({"-f"});
  EXPECT_EQ(Count(again.err, "<default>: Tightened " + prefs + " from 0755 to 0700\n"), 1u);
  EXPECT_EQ(Count(again.err, "<default>: Tightened " + Logs()[0] + " from 0644 to 0600\n"), 1u);
  for (const Entry& e : Everything()) EXPECT_EQ(e.mode & 077, 0u) << e.path;
}

TEST_F(PrivacyTest, AGroupNamedByTheDeploymentMayRead) {
  struct group* g = getgrgid(getegid());
  ASSERT_NE(g, nullptr);
  env["TALLYRUN_GROUP"] = g->gr_name;
  TempDir fresh;
  env["TALLYRUN_ROOT"] = fresh.path() + "/root";
  ASSERT_EQ(RunProgram(DEVSIM_BIN, {"init", fresh.path() + "/root"}, env).status, 0);
  const RunResult r = Tallyrun({"-f"});
  struct stat st;
  size_t checked = 0;
  for (const auto& e : fs::recursive_directory_iterator(fresh.path() + "/root")) {
    ASSERT_EQ(lstat(e.path().c_str(), &st), 0);
    const bool is_library = e.path().filename() == "FaultkeepSupport";
    EXPECT_EQ(st.st_mode & 07777, S_ISDIR(st.st_mode) ? 0750u : (is_library ? 0740u : 0640u)) << e.path();
    EXPECT_EQ(st.st_gid, g->gr_gid) << e.path();
    ++checked;
  }
  EXPECT_GT(checked, 20u) << r.err;
}

TEST_F(PrivacyTest, CodeOthersCouldWriteIsNotLoaded) {
  for (const std::string& writable : {library, fs::path(library).parent_path().string()}) {
    SCOPED_TRACE(writable);
    struct stat st;
    ASSERT_EQ(stat(writable.c_str(), &st), 0);
    ASSERT_EQ(chmod(writable.c_str(), (st.st_mode & 07777) | 0020), 0);
    const size_t before = Logs().size();
    const RunResult r = Tallyrun({"-f"});
    EXPECT_EQ(Count(r.err, "<error>: Not loading " + library + ": " + writable +
                               " is writable by its group or by others\n"),
              1u)
        << r.err;
    EXPECT_EQ(Count(r.err, "Failed to dynamically load the FaultkeepSupport framework"), 1u);
    ASSERT_EQ(Logs().size(), before + 1);  // the log is still written
    const cf::Dictionary log = LastLog();
    const cf::Value corruptions = log.Get("TBScalars").AsDictionary()->Get("com.velmora.diagvault.tbkd.database.corruptions");
    EXPECT_EQ(corruptions, cf::Value::SInt64(0));  // without the library, nothing to read
    ASSERT_EQ(chmod(writable.c_str(), st.st_mode & 07777), 0);  // not touched by the run
  }
  // Trusted again: loaded without a word.
  EXPECT_EQ(Count(Tallyrun({"-f"}).err, "Not loading"), 0u);
}

TEST_F(PrivacyTest, LinksPlantedInTheRootAreNeverWrittenThrough) {
  TempDir outside;
  const std::string target = outside / "target";
  ASSERT_TRUE(platform::WriteFileAtomically(target, "untouched"));
  // A gate domain elsewhere that would hold every day back, were it read.
  const std::string gate = outside / "gate.plist";
  ASSERT_TRUE(platform::WriteFileAtomically(
      gate, "<plist version=\"1.0\"><dict><key>" + std::string(platform::kGateKey) +
                "</key><integer>99999</integer></dict></plist>"));
  const std::string events = root / "var/eventlens/events.jsonl";
  const std::string prefs = root / ("Library/Preferences/" + kDomain + ".plist");
  fs::remove(events);
  fs::remove(prefs);
  fs::create_directories(fs::path(events).parent_path());
  fs::create_directories(fs::path(prefs).parent_path());
  fs::create_symlink(target, events);
  fs::create_symlink(gate, prefs);
  // A directory on the way that is a link: nothing may land in it.
  fs::remove_all(root / "var/run");
  fs::create_directory(outside / "run");
  fs::create_directory_symlink(outside / "run", root / "var/run");

  const RunResult r = Tallyrun({"-d"});
  EXPECT_GE(Count(r.err, events + " is a symbolic link; refusing to write through it"), 1u) << r.err;
  EXPECT_GE(Count(r.err, prefs + " is a symbolic link; refusing to read through it"), 1u);
  EXPECT_GE(Count(r.err, prefs + " is a symbolic link; refusing to replace it"), 1u);
  EXPECT_EQ(Count(r.err, "<default>: tallyrun ended\n"), 1u);
  EXPECT_EQ(Logs().size(), 1u);  // the gate was not read from elsewhere; the rest of the run completed
  EXPECT_EQ(*platform::ReadFile(target), "untouched");
  EXPECT_TRUE(fs::is_empty(outside / "run"));
  EXPECT_TRUE(fs::is_symlink(events));
  EXPECT_TRUE(fs::is_symlink(prefs));

  // The store, its write-ahead log or its index linked elsewhere: the store
  // is not opened, and nothing is written beside the link's target.
  const fs::path store = root / std::string(platform::kStoreDevicePath).substr(1);
  const fs::path moved = fs::path(outside.path()) / "store" / "TBDataStore.sqlitedb";
  fs::create_directory(moved.parent_path());
  for (const char* part : {"-wal", "-shm"})
    if (fs::exists(store.string() + part)) fs::remove(store.string() + part);  // the run closed the store
  fs::rename(store, moved);
  const auto bytes = platform::ReadFile(moved);
  for (const char* link : {"", "-wal", "-shm"}) {
    SCOPED_TRACE(link);
    const fs::path at = store.string() + link;
    if (*link) fs::rename(moved, store);
    fs::create_symlink(*link ? fs::path(outside / "elsewhere") : moved, at);
    const RunResult linked = Tallyrun({"-f"});
    EXPECT_GE(Count(linked.err, at.string() + " is a symbolic link; refusing to open the store through it"), 1u)
        << linked.err;
    fs::remove(at);
    if (*link) fs::rename(store, moved);
  }
  EXPECT_EQ(platform::ReadFile(moved), bytes);
  EXPECT_EQ(std::distance(fs::directory_iterator(moved.parent_path()), fs::directory_iterator()), 1);  // no -wal, -shm
  EXPECT_FALSE(fs::exists(outside / "elsewhere"));
}

TEST_F(PrivacyTest, AnUnprivilegedUserRunsTheWholeJobOnItsOwnRoot) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to switch to an unprivileged user; this runs as uid " << geteuid();
  struct passwd* nobody = getpwnam("nobody");
  if (!nobody) GTEST_SKIP() << "no user 'nobody' on this machine";
  // The build may sit where only its owner can reach it (a home directory).
  const pid_t probe = fork();
  if (probe == 0) {
    const bool reachable = setgroups(0, nullptr) == 0 && setgid(nobody->pw_gid) == 0 && setuid(nobody->pw_uid) == 0 &&
                           access(DEVSIM_BIN, X_OK) == 0 && access(TALLYRUN_BIN, X_OK) == 0;
    _exit(reachable ? 0 : 1);
  }
  int probe_status = 0;
  waitpid(probe, &probe_status, 0);
  if (!WIFEXITED(probe_status) || WEXITSTATUS(probe_status) != 0)
    GTEST_SKIP() << "user 'nobody' cannot reach the programs under test (" << DEVSIM_BIN << ")";
  TempDir home;
  const std::string user_root = home / "root";
  ASSERT_EQ(chown(home.path().c_str(), nobody->pw_uid, nobody->pw_gid), 0);
  auto as_nobody = [&](const std::string& program, const std::vector<std::string>& args) {
    auto e = env;
    e["TALLYRUN_ROOT"] = user_root;
    return RunProgram(program, args, e, nobody->pw_uid, nobody->pw_gid);
  };
  const RunResult init = as_nobody(DEVSIM_BIN, {"init", user_root});
  ASSERT_EQ(init.status, 0) << init.err;
  const RunResult r = as_nobody(TALLYRUN_BIN, {"-f"});
  EXPECT_EQ(Count(r.err, "Not loading"), 0u) << r.err;
  EXPECT_EQ(Count(r.err, "<error>"), 0u) << r.err;
  size_t logs = 0;
  struct stat st;
  for (const auto& e : fs::recursive_directory_iterator(user_root)) {
    ASSERT_EQ(lstat(e.path().c_str(), &st), 0);
    EXPECT_EQ(st.st_uid, nobody->pw_uid) << e.path();
    EXPECT_EQ(st.st_mode & 077, 0u) << e.path();
    logs += e.path().extension() == ".193";
  }
  EXPECT_EQ(logs, 1u);
}

}  // namespace
