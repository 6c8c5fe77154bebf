#include "platform/diagnostics.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <utime.h>

#include <filesystem>

#include "../../tests/temp_dir.h"
#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"

namespace platform {
namespace {

class DiagnosticsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    setenv("TZ", "UTC0", 1);
    tzset();
  }
  TempDir root;
  std::shared_ptr<FixedClock> clock = std::make_shared<FixedClock>(*ParseInstant("2026-11-22T10:20:30Z"));
  std::shared_ptr<CaptureLog> log = std::make_shared<CaptureLog>();
  ContextScope scope{root.path(), Backends{clock, log}};

  std::vector<std::string> Files(const std::string& rel) {
    std::vector<std::string> out;
    std::error_code ec;
    for (const auto& e : std::filesystem::directory_iterator(root / rel, ec)) out.push_back(e.path().filename());
    std::sort(out.begin(), out.end());
    return out;
  }
  void Touch(const std::string& rel, double mtime) {
    ASSERT_TRUE(WriteFileAtomically(root / rel, "x"));
    struct utimbuf t{static_cast<time_t>(mtime), static_cast<time_t>(mtime)};
    utime((root / rel).c_str(), &t);
  }
};

TEST_F(DiagnosticsTest, SubmissionsAreExactUniqueAndDescribed) {
  auto writer = [](const std::string& bytes) {
    return [bytes](LogOutput& out) { out.Write(bytes); };
  };
  cf::Dictionary options;
  options.Set("previous_os_version", "1.0 (A)");
  ASSERT_TRUE(DGVWriteLogForSubmission("193", "log-aggregated", options, cf::Value(), writer("first")));
  ASSERT_TRUE(DGVWriteLogForSubmission("193", "log-aggregated", cf::Value(), cf::Value(), writer("second")));
  ASSERT_TRUE(DGVWriteLogForSubmission("193", "log-aggregated", cf::Value(), cf::Value(), writer("")));
  EXPECT_EQ(Files("var/diagvault/submissions"),
            (std::vector<std::string>{"log-aggregated_2026-11-22-102030-1.193", "log-aggregated_2026-11-22-102030-1.193.json",
                                      "log-aggregated_2026-11-22-102030-2.193", "log-aggregated_2026-11-22-102030-2.193.json",
                                      "log-aggregated_2026-11-22-102030.193", "log-aggregated_2026-11-22-102030.193.json"}));
  const std::string dir = root / "var/diagvault/submissions/";
  EXPECT_EQ(*ReadFile(dir + "log-aggregated_2026-11-22-102030.193"), "first");
  EXPECT_EQ(*ReadFile(dir + "log-aggregated_2026-11-22-102030-2.193"), "");
  auto description = [&](const std::string& name) {
    const cf::Value v = cf::ParseJSON(ReadFile(dir + name + ".json").value_or("")).value;
    return v.AsDictionary() ? *v.AsDictionary() : cf::Dictionary();
  };
  const cf::Dictionary first = description("log-aggregated_2026-11-22-102030.193");
  EXPECT_EQ(first.Get("type"), cf::Value("193"));
  EXPECT_EQ(first.Get("name"), cf::Value("log-aggregated"));
  EXPECT_EQ(first.Get("options"), cf::Value(options));
  EXPECT_EQ(first.Get("created"), cf::Value("2026-11-22T10:20:30Z"));
  EXPECT_EQ(description("log-aggregated_2026-11-22-102030-1.193").Get("options"), cf::Value(cf::Dictionary()));

  // A submissions path that cannot be a directory: false, nothing left behind.
  TempDir other;
  ASSERT_TRUE(WriteFileAtomically(other / "var/diagvault/submissions", "a file in the way"));
  ContextScope blocked(other.path(), Backends{clock, log});
  EXPECT_FALSE(DGVWriteLogForSubmission("193", "log-aggregated", cf::Value(), cf::Value(), writer("x")));
  EXPECT_EQ(log->Count("Cannot create " + (other / "var/diagvault/submissions") + ": Not a directory"), 1u);
  EXPECT_FALSE(DGVWriteLogForSubmission("1/93", "log", cf::Value(), cf::Value(), writer("x")));
  EXPECT_EQ(*ReadFile(other / "var/diagvault/submissions"), "a file in the way");
}

TEST_F(DiagnosticsTest, AnswersAndOSVersion) {
  EXPECT_TRUE(DiagnosticLogSubmissionEnabled());  // no answers file
  EXPECT_FALSE(DVGetBoolAnswer("InternalBuild"));
  ASSERT_TRUE(WriteFileAtomically(root / "device/answers.plist", "not a plist"));
  EXPECT_TRUE(DiagnosticLogSubmissionEnabled());
  EXPECT_EQ(log->CountContaining("answers.plist is not a property list (malformed XML property list)"), 1u);
  cf::Dictionary answers;
  answers.Set("DiagnosticLogSubmissionEnabled", cf::Value::Bool(false));
  answers.Set("InternalBuild", cf::Value::SInt32(1));
  answers.Set("InverseDeviceID", "abc");
  std::string bytes;
  cf::WriteXMLPropertyList(answers, bytes, nullptr);
  ASSERT_TRUE(WriteFileAtomically(root / "device/answers.plist", bytes));
  EXPECT_FALSE(DiagnosticLogSubmissionEnabled());
  EXPECT_TRUE(DVGetBoolAnswer("InternalBuild"));
  EXPECT_EQ(DVCopyAnswer("InverseDeviceID"), cf::Value("abc"));

  cf::Dictionary version;
  version.Set("ProductVersion", "4.2");
  version.Set("ProductBuildVersion", "22C41");
  cf::WriteXMLPropertyList(version, bytes, nullptr);
  ASSERT_TRUE(WriteFileAtomically(root / "device/system-version.plist", bytes));
  EXPECT_EQ(DGVOSVersion(), "4.2 (22C41)");
  // Without a profile the Linux release describes itself: "<version> (<build>)".
  std::filesystem::remove(root / "device/system-version.plist");
  const std::string linux_version = DGVOSVersion();
  EXPECT_NE(linux_version.find(" ("), std::string::npos);
  EXPECT_EQ(linux_version.back(), ')');

  const std::string md5 = CC_MD5("abc");
  EXPECT_EQ(cf::Value::Bytes(cf::Data(md5.begin(), md5.end())).Description(),
            "<90015098 3cd24fb0 d6963f7d 28e17f72>");
}

TEST_F(DiagnosticsTest, HousekeepingMovesOldLogsKeepsSevenAndPosts) {
  const double today = *ParseInstant("2026-11-22T00:00:00Z");
  Touch("var/faultkeep/structured.jsonl", today - 3600);   // yesterday: moves
  Touch("var/faultkeep/fresh.jsonl", today + 60);          // today: stays
  Touch("var/faultkeep/old/structured-2026-11-20.jsonl", today - 86400 * 2);
  FKDumpAllOldStructuredDataLogs();
  EXPECT_EQ(Files("var/faultkeep"), (std::vector<std::string>{"fresh.jsonl", "old"}));
  EXPECT_EQ(Files("var/faultkeep/old"),
            (std::vector<std::string>{"structured-2026-11-20.jsonl", "structured-2026-11-21.jsonl"}));
  // Logs named for their day roll by that day, whatever their stamp: one
  // written "today" by a fixed clock stays, yesterday's goes under its name.
  Touch("var/faultkeep/structured_2026-11-22.jsonl", today - 86400 * 5);
  Touch("var/faultkeep/structured_2026-11-21.jsonl", today + 3600);
  FKDumpAllOldStructuredDataLogs();
  EXPECT_EQ(Files("var/faultkeep"), (std::vector<std::string>{"fresh.jsonl", "old", "structured_2026-11-22.jsonl"}));
  EXPECT_EQ(Files("var/faultkeep/old"), (std::vector<std::string>{"structured-2026-11-20.jsonl",
                                                                   "structured-2026-11-21.jsonl",
                                                                   "structured_2026-11-21.jsonl"}));
  std::filesystem::remove(root / "var/faultkeep/structured_2026-11-22.jsonl");
  cf::Dictionary record;
  record.Set("id", cf::Value::SInt32(7));
  record.Set("blob", cf::Value::Bytes(cf::Data{1, 2, 255}));
  ASSERT_TRUE(FKLogStructuredData(172, record));
  const std::string line = *ReadFile(root / "var/faultkeep/structured_2026-11-22.jsonl");
  ASSERT_EQ(line.back(), '\n');
  const cf::Value logged = cf::ParseJSON(line).value;
  ASSERT_NE(logged.AsDictionary(), nullptr) << line;
  EXPECT_EQ(logged.AsDictionary()->Get("time"), cf::Value("2026-11-22T10:20:30Z"));
  EXPECT_EQ(logged.AsDictionary()->Get("type"), cf::Value::SInt32(172));
  record.Set("blob", "AQL/");  // data in base64
  EXPECT_EQ(logged.AsDictionary()->Get("record"), cf::Value(record));
  FKDumpAllOldStructuredDataLogs();  // nothing left to move; no directory: no failure
  TempDir empty;
  { ContextScope s(empty.path(), Backends{clock, log}); FKDumpAllOldStructuredDataLogs(); rollHalvernLogs(); }

  for (int i = 0; i < 10; ++i) Touch("var/halvern/log" + std::to_string(i), today - 1000 * (10 - i));
  rollHalvernLogs();
  EXPECT_EQ(Files("var/halvern"),
            (std::vector<std::string>{"log3", "log4", "log5", "log6", "log7", "log8", "log9"}));

  notify_post("com.velmora.da.tasking_changed");
  clock->Set(clock->Now() + 1);
  notify_post("com.velmora.tallybookd.tallyrun.logging");
  EXPECT_EQ(*ReadFile(root / "var/run/notifications.log"),
            "2026-11-22T10:20:30Z com.velmora.da.tasking_changed\n"
            "2026-11-22T10:20:31Z com.velmora.tallybookd.tallyrun.logging\n");
}

}  // namespace
}  // namespace platform
