// The README's first session and its hand-written tasking, run as they
// stand: a reader who follows them gets what they promise.
#include "platform/clock.h"
#include "root_fixture.h"

namespace {

namespace fs = std::filesystem;

// The text between the line `open` and the next line `close` of the README
// (without either), or empty.
std::string ReadmeBlock(const std::string& open, const std::string& close) {
  const std::string text = platform::ReadFile(README_PATH).value_or("");
  const size_t start = text.find(open + "\n");
  if (start == std::string::npos) return "";
  const size_t body = start + open.size() + 1;
  const size_t end = text.find("\n" + close + "\n", body);
  return end == std::string::npos ? "" : text.substr(body, end - body + 1);
}

class ReadmeTest : public RootTest {
 protected:
  void SetUp() override {
    // As a reader runs it: the real clock, the tools on PATH.
    env.erase("TALLYRUN_NOW");
    env.erase("TALLYRUN_LOG_STDERR");
    std::string path;
    for (const char* program : {TALLYBOOK_BIN, TALLYCTL_BIN, TALLYRUN_BIN, DEVSIM_BIN})
      path += fs::path(program).parent_path().string() + ":";
    env["PATH"] = path + "/usr/bin:/bin";
    RootTest::SetUp();
  }
};

TEST_F(ReadmeTest, TheFirstSessionRunsAsWritten) {
  std::string block = ReadmeBlock("<!-- first-session -->", "<!-- /first-session -->");
  ASSERT_EQ(block.rfind("```sh\n", 0), 0u) << "the marked block is one sh code block";
  block = block.substr(6, block.rfind("```") - 6);
  // What scripts/run.sh has done before it: one run of yesterday.
  ASSERT_EQ(Tallyrun({"-f"}).status, 0);
  TempDir cwd;
  const RunResult r = RunProgram("/bin/bash", {"-euo", "pipefail", "-c", "cd " + cwd.path() + " && " + block}, env);
  ASSERT_EQ(r.status, 0) << r.out << r.err;
  // Whatever day it runs on: what is checked is what the block itself did.
  const size_t said = r.out.find("today is day ");
  ASSERT_NE(said, std::string::npos) << r.out;
  const long today = std::stol(r.out.substr(said + 13));
  EXPECT_NE(r.out.find("\"TBStartDate\": \"" + platform::DayDate(today - 1)), std::string::npos) << r.out;
  EXPECT_NE(r.out.find("state:    ok\n"), std::string::npos) << r.out;
  EXPECT_NE(r.out.find("\n" + std::to_string(today - 1) + " com.velmora.homedeck.Unlocks "), std::string::npos)
      << r.out;  // yesterday's sample value, as the root was made
  EXPECT_NE(r.out.find("\"com.velmora.homedeck.Unlocks\": 42"), std::string::npos) << r.out;
}

TEST_F(ReadmeTest, TheHandWrittenTaskingIsApplied) {
  std::string block = ReadmeBlock("```xml", "```");
  ASSERT_NE(block.find("ScheduledTasking"), std::string::npos);
  ASSERT_TRUE(platform::WriteFileAtomically(root / "var/diagvault/config/com.velmora.OTAFerrowin.plist", block));
  ASSERT_EQ(Tallyrun({"-f"}).status, 0);
  const cf::Value mobile = ReadPlist(root / "Library/Preferences/com.example.feature.plist");
  const cf::Value diag = ReadPlist(root / "var/diagvault/config/com.example.diag.plist");
  const cf::Value guest = ReadPlist(root / "var/users/guest/Library/Preferences/com.example.app.plist");
  ASSERT_TRUE(mobile.AsDictionary() && diag.AsDictionary() && guest.AsDictionary());
  EXPECT_EQ(mobile.AsDictionary()->Get("Enabled"), cf::Value::Bool(true));
  EXPECT_EQ(diag.AsDictionary()->Get("Level"), cf::Value::SInt64(3));
  EXPECT_EQ(guest.AsDictionary()->Get("Theme"), cf::Value("dark"));
}

}  // namespace
