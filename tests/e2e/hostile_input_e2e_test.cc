// The daily job on device files that are hostile or not files at all: each
// is refused with one line naming it, and the run completes.
#include <sys/stat.h>

#include "root_fixture.h"

namespace {

using HostileInputTest = RootTest;

std::string BigEndian(uint64_t v, int bytes) {
  std::string out;
  for (int i = bytes - 1; i >= 0; --i) out += static_cast<char>(v >> (8 * i));
  return out;
}

// A binary list of about 1 MiB: one 512 KiB string referenced from each of
// 131,000 array slots, 64 GiB once decoded.
std::string SharedStringList() {
  std::string out = "bplist00";
  out += "\xAF\x12" + BigEndian(131'000, 4);
  for (int i = 0; i < 131'000; ++i) out += BigEndian(1, 4);
  const uint64_t leaf = out.size();
  out += "\x5F\x12" + BigEndian(512 << 10, 4) + std::string(512 << 10, 's');
  const uint64_t table = out.size();
  out += BigEndian(8, 4) + BigEndian(leaf, 4);
  out += std::string(6, '\0') + "\x04\x04" + BigEndian(2, 8) + BigEndian(0, 8) + BigEndian(table, 8);
  return out;
}

// A watchdog, so that a run that hangs fails instead of stalling the suite.
RunResult TallyrunWithin(const std::map<std::string, std::string>& env, const std::vector<std::string>& args) {
  std::vector<std::string> all{"120", TALLYRUN_BIN};
  all.insert(all.end(), args.begin(), args.end());
  return RunProgram("/usr/bin/timeout", all, env);
}

TEST_F(HostileInputTest, AnswersThatDecodeToGigabytesAreRefused) {
  const std::string list = SharedStringList();
  ASSERT_LT(list.size(), size_t{1} << 20);
  ASSERT_TRUE(platform::WriteFileAtomically(root / "device/answers.plist", list));
  const RunResult r = TallyrunWithin(env, {"-f"});
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(Count(r.err, "<error>: " + root / "device/answers.plist" +
                             " is not a property list (binary property list too large when decoded); ignoring it\n"),
            1u);
  EXPECT_EQ(Count(r.err, "<default>: tallyrun ended\n"), 1u);
  EXPECT_EQ(Logs().size(), 1u);  // submission defaults to enabled
}

TEST_F(HostileInputTest, DeviceFilesThatAreNotSmallRegularFilesAreRefusedOnce) {
  const std::string sysctl = root / "device/sysctl.plist";
  ASSERT_EQ(unlink(sysctl.c_str()), 0);
  ASSERT_EQ(mkfifo(sysctl.c_str(), 0600), 0);
  const std::string version = root / "device/system-version.plist";
  ASSERT_EQ(unlink(version.c_str()), 0);
  ASSERT_EQ(symlink("/dev/zero", version.c_str()), 0);
  const std::string apps = root / "device/apps.plist";
  ASSERT_TRUE(platform::WriteFileAtomically(
      apps, "<plist version=\"1.0\"><array>" + std::string(17 << 20, ' ') + "</array></plist>"));

  const RunResult r = TallyrunWithin(env, {"-f"});
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(Count(r.err, "<error>: " + sysctl + " is not a regular file; ignoring it\n"), 1u);
  EXPECT_EQ(Count(r.err, "<error>: " + version + " is not a regular file; ignoring it\n"), 1u);
  EXPECT_EQ(Count(r.err, "<error>: " + apps + " is 17825836 bytes, over the limit of 16777216; ignoring it\n"), 1u);
  EXPECT_EQ(Count(r.err, "<default>: tallyrun ended\n"), 1u);
  EXPECT_EQ(Logs().size(), 1u);
}

}  // namespace
