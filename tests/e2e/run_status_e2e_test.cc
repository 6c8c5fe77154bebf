// What a run leaves for its scheduler and a person: the record of the last
// run, `tallybook status` reading it, and tallyrun's answers before it runs
// anything (options, roots, clocks).
#include <sys/stat.h>

#include <functional>
#include <regex>

#include "root_fixture.h"

namespace {

namespace fs = std::filesystem;

const std::string kRecord = "var/tallyrun/last-run.plist";

class RunStatusTest : public RootTest {
 protected:
  RunResult Status(const std::vector<std::string>& args = {}) {
    std::vector<std::string> all{"status"};
    all.insert(all.end(), args.begin(), args.end());
    return RunProgram(TALLYBOOK_BIN, all, env);
  }
  cf::Dictionary Record() {
    const cf::Value v = ReadPlist(root / kRecord);
    return v.AsDictionary() ? *v.AsDictionary() : cf::Dictionary();
  }
};

// Each way a run can end, as the record and `tallybook status` tell i
TEST_F(RunStatusTest, EveryRunRecordsHowItWent) {
  struct Case {
    const char* name;
    std::function<void()> before;
    std::string arg;
    const char* outcome;
    int32_t day;
    int status;
    std::string said;  // in the status text
  };
  const auto answers_off = [this] {
    cf::Dictionary answers;
    answers.Set("DiagnosticLogSubmissionEnabled", cf::Value::Bool(false));
    WritePlist("device/answers.plist", answers);
  };
  const Case cases[] = {
      {"a forced run submits", nullptr, "-f", "submitted", kToday - 1, 0, "state:    ok\n"},
      {"today's work", nullptr, "-t", "submitted", kToday, 0, "run:      -t for day 20779 (2026-11-22)\n"},
      {"a gated run twice", [this] { Tallyrun({"-d"}); }, "-d", "unchanged", kToday - 1, 0,
       "outcome:  unchanged\n"},
      {"submission off", answers_off, "-d", "submission-off", kToday - 1, 0, "state:    ok\n"},
      {"a day the store has no rows for",
       [this] { env["TALLYRUN_NOW"] = "2027-01-01T12:00:00Z"; }, "-f", "nothing-whitelisted", 20818,
       0, "outcome:  nothing-whitelisted\n"},
      // What the machine lacks is no failure: a device with nothing in i
      {"an empty device",
       [this] {
         for (const auto& e : fs::directory_iterator(root / "device")) fs::remove_all(e.path());
       },
       "-f", "submitted", kToday - 1, 0, "errors:   0 lines\n"},
      {"no whitelist",
       [this] { fs::remove(root / "Library/Application Support/Tallybook/Whitelist_boxOS.plist"); },
       "-f", "failed", kToday - 1, 1, "state:    failed: an error line: Couldn't load whitelist\n"},
      {"a corrupt store",
       [this] {
         ASSERT_TRUE(platform::WriteFileAtomically(root / "var/mobile/Library/Tallybook/TBDataStore.sqlitedb",
                                                   std::string(8192, 'x')));
       },
       "-f", "failed", kToday - 1, 1, "state:    failed: "},
      {"submissions cannot be written",
       [this] {
         fs::remove_all(root / "var/diagvault/submissions");
         ASSERT_TRUE(platform::WriteFileAtomically(root / "var/diagvault/submissions", "a file in the way"));
       },
       "-f", "failed", kToday - 1, 1, "errors:   "},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    SetUp();  // a fresh root for each case
    const std::string now = env["TALLYRUN_NOW"];
    if (c.before) c.before();
    const RunResult r = Tallyrun({c.arg});
    EXPECT_EQ(r.status, 0) << "the exit status stays 0 whatever happened";
    const cf::Dictionary record = Record();
    EXPECT_EQ(record.Get("mode"), cf::Value(c.arg));
    EXPECT_EQ(record.Get("outcome"), cf::Value(c.outcome)) << r.err;
    EXPECT_EQ(record.Get("day"), cf::Value::SInt32(c.day));
    ASSERT_TRUE(record.Get("started").AsDate() && record.Get("ended").AsDate());
    EXPECT_LE(record.Get("started").AsDate()->seconds, record.Get("ended").AsDate()->seconds);
    const uint64_t errors = record.Get("errorCount").AsNumber() ? record.Get("errorCount").AsNumber()->AsUInt64() : 99;
    EXPECT_EQ(errors, Count(r.err, "<error>: ") - (c.status == 1 ? 1 : 0)) << "the closing line is not counted";
    EXPECT_EQ(errors == 0, c.status == 0) << r.err;
    const cf::Array* quoted = record.Get("errors").AsArray();
    ASSERT_TRUE(quoted);
    EXPECT_EQ(quoted->size(), std::min<size_t>(errors, 5));
    if (std::string(c.outcome) == "submitted") {
      ASSERT_FALSE(Logs().empty());
      EXPECT_EQ(record.Get("log"), cf::Value(fs::path(Logs().back()).filename().string()));
    }
    // The driver's last line says the same.
    EXPECT_EQ(Count(r.err, ": run " + std::string(c.outcome) + " for day " + std::to_string(c.day) + " ("), 1u)
        << r.err;
    struct stat st {};
    ASSERT_EQ(stat((root / kRecord).c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);

    const RunResult s = Status();
    EXPECT_EQ(s.status, c.status) << s.out << s.err;
    EXPECT_NE(s.out.find(c.said), std::string::npos) << s.out;
    env["TALLYRUN_NOW"] = now;
  }
}

TEST_F(RunStatusTest, StatusTellsASchedulerWhatItNeeds) {
  RunResult s = Status();
  EXPECT_EQ(s.status, 3);
  EXPECT_EQ(s.out, "state:    none: no run has been recorded in this root\n");

  ASSERT_EQ(Tallyrun({"-d"}).status, 0);
  EXPECT_EQ(Status().status, 0);
  // 26 hours by default; a longer allowance on reques
  env["TALLYRUN_NOW"] = "2026-11-23T17:00:01Z";
  s = Status();
  EXPECT_EQ(s.status, 3);
  EXPECT_NE(s.out.find("state:    stale: the last run is older than 26.0 h\n"), std::string::npos) << s.out;
  EXPECT_EQ(Status({"--max-age", "27"}).status, 0);
  EXPECT_EQ(Status({"--max-age", "-1"}).status, 2);

  // For a machine: one JSON object with the verdict and the record.
  s = Status({"--json"});
  EXPECT_EQ(s.status, 3);
  const cf::Value json = cf::ParseJSON(s.out).value;
  ASSERT_TRUE(json.AsDictionary()) << s.out;
  EXPECT_EQ(json.AsDictionary()->Get("state"), cf::Value("stale"));
  EXPECT_EQ(json.AsDictionary()->Get("exitStatus"), cf::Value::SInt64(3));
  const cf::Dictionary* last = json.AsDictionary()->Get("lastRun").AsDictionary();
  ASSERT_TRUE(last);
  EXPECT_EQ(last->Get("outcome"), cf::Value("submitted"));
  EXPECT_EQ(last->Get("date"), cf::Value("2026-11-21"));

  // A gate ahead of the clock holds every day back: until when.
  env["TALLYRUN_NOW"] = "2026-11-22T15:00:00Z";
  cf::Dictionary prefs;
  prefs.Set(kGate, cf::Value::SInt32(kToday + 5));
  WritePlist("Library/Preferences/" + kDomain + ".plist", prefs);
  const RunResult held = Tallyrun({"-d"});
  EXPECT_EQ(Count(held.err, "ahead of yesterday (day 20778): no day runs until day 20785"), 1u) << held.err;
  s = Status();
  EXPECT_EQ(s.status, 3);
  EXPECT_NE(s.out.find("state:    held: the gate record holds day 20784 (2026-11-27), ahead of yesterday: gated "
                       "runs do nothing until 2026-11-29\n"),
            std::string::npos)
      << s.out;

  // A run that never ended, its process gone; a record no one can read.
  cf::Dictionary record = Record();
  record.Set("outcome", "running");
  const pid_t gone = fork();
  if (gone == 0) _exit(0);
  waitpid(gone, nullptr, 0);
  record.Set("pid", cf::Value::SInt64(gone));
  WritePlist(kRecord, record);
  fs::remove(root / ("Library/Preferences/" + kDomain + ".plist"));
  s = Status();
  EXPECT_EQ(s.status, 1);
  EXPECT_NE(s.out.find("state:    interrupted: "), std::string::npos) << s.out;
  // A record that is no record, or not a file the job wrote: said, never
  // waited on or followed.
  ASSERT_TRUE(platform::WriteFileAtomically(root / kRecord, "<plist"));
  s = Status();
  EXPECT_EQ(s.status, 1);
  EXPECT_EQ(s.out, "state:    unreadable: " + root / kRecord + " is not a run record\n");
  fs::remove(root / kRecord);
  ASSERT_EQ(mkfifo((root / kRecord).c_str(), 0600), 0);
  s = Status();
  EXPECT_EQ(s.out, "state:    unreadable: " + root / kRecord + " is not a regular file; refusing to read it\n");
  fs::remove(root / kRecord);
  fs::create_symlink(root / "elsewhere.plist", root / kRecord);
  WritePlist("elsewhere.plist", record);
  s = Status();
  EXPECT_EQ(s.status, 1);
  EXPECT_EQ(s.out, "state:    unreadable: " + root / kRecord + " is a symbolic link; refusing to read through it\n");

  // No root: failed, and nothing is made.
  env["TALLYRUN_ROOT"] = root / "nowhere";
  s = Status();
  EXPECT_EQ(s.status, 1);
  EXPECT_FALSE(fs::exists(root / "nowhere"));
}

// Before any work: options it does not run, roots it must not touch, a
// clock it cannot read. The exit status is 0 throughou
TEST_F(RunStatusTest, WhatStopsARunBeforeItStarts) {
  for (const char* arg : {"--help", "-h"}) {
    const RunResult r = Tallyrun({arg});
    EXPECT_EQ(r.status, 0);
    EXPECT_EQ(Count(r.err, std::string("<default>: Unknown arg: ") + arg + "\n"), 1u) << r.err;
    EXPECT_NE(r.err.find("\nusage: tallyrun [-d | -f | -t]\n"), std::string::npos) << r.err;
    EXPECT_NE(r.err.find("TALLYRUN_ROOT"), std::string::npos);
    EXPECT_NE(r.err.find("journalctl -t tallyrun"), std::string::npos);
  }
  RunResult r = Tallyrun({"--version"});
  EXPECT_EQ(r.status, 0);
  EXPECT_TRUE(std::regex_search(r.err, std::regex("Unknown arg: --version\ntallyrun \\d+\\.\\d+\\.\\d+\n"))) << r.err;
  r = Tallyrun({"--frobnicate"});
  EXPECT_NE(r.err.find("tallyrun: unknown option '--frobnicate'; nothing was run"), std::string::npos) << r.err;
  EXPECT_FALSE(fs::exists(root / kRecord)) << "nothing ran, so there is no run to record";

  // A clock it cannot read: nothing runs, the record says why.
  env["TALLYRUN_NOW"] = "2026-11-2";
  r = Tallyrun({"-f"});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(Count(r.err, "<error>: TALLYRUN_NOW=\"2026-11-2\" is not a moment: "), 1u) << r.err;
  EXPECT_EQ(Count(r.err, "daily tasks"), 0u);
  EXPECT_TRUE(Logs().empty());
  EXPECT_EQ(Record().Get("outcome"), cf::Value("failed"));
  env["TALLYRUN_NOW"] = "2026-11-22T15:00:00Z";
  EXPECT_EQ(Status().status, 1);

  // Roots: a missing one is not made, a directory that is not one is not
  // touched, and `/` is never one. A person without the mirrored log still
  // hears it once.
  env.erase("TALLYRUN_LOG_STDERR");
  const fs::path plain = root / "plain";
  fs::create_directories(plain / "var/tmp");
  fs::create_directories(plain / "var/lib/dpkg");
  fs::permissions(plain / "var/tmp", fs::perms(01777));
  ASSERT_TRUE(platform::WriteFileAtomically(plain / "var/lib/dpkg/status.tmp.abc123", "half"));
  const struct {
    std::string root, said;
  } roots[] = {
      {root / "nowhere", "no device root at " + root / "nowhere" + "; make one with: devsim init " + root / "nowhere" +
                             " (and set TALLYRUN_ROOT=" + root / "nowhere" + "); nothing was run\n"},
      {plain, plain.string() + " is not a device root (it has no .tallyrun-root and no store); make one with: "},
      {"/", "/ is never a device root; make one with: devsim init DIR (and set TALLYRUN_ROOT=DIR); nothing was run\n"},
  };
  for (const auto& c : roots) {
    SCOPED_TRACE(c.root);
    env["TALLYRUN_ROOT"] = c.root;
    for (const char* arg : {"-t", "-d"}) {
      r = Tallyrun({arg});
      EXPECT_EQ(r.status, 0);
      EXPECT_EQ(Count(r.err, "tallyrun: " + c.said), 1u) << r.err;
    }
  }
  EXPECT_FALSE(fs::exists(root / "nowhere"));
  EXPECT_EQ(fs::status(plain / "var/tmp").permissions(), fs::perms(01777));
  EXPECT_TRUE(fs::exists(plain / "var/lib/dpkg/status.tmp.abc123"));
  EXPECT_FALSE(fs::exists(plain / "var/run"));
}

}  // namespace
