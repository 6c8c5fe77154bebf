// Whole daily runs on a root whose controller is this machine's own disk
// (devsim init --host). What the disk says differs from machine to machine,
// so these tests check that its numbers arrive, not what they are.
#include <fcntl.h>
#include <sys/vfs.h>

#include "root_fixture.h"

namespace {

// The disks whose statistics can be read, as a host root lists them.
std::vector<std::string> ReadableDisks() {
  std::vector<std::string> out;
  std::error_code ec;
  for (const auto& e : std::filesystem::directory_iterator("/sys/block", ec)) {
    const std::string name = e.path().filename();
    if (name.rfind("loop", 0) == 0 || name.rfind("ram", 0) == 0 || name.rfind("zram", 0) == 0) continue;
    if (platform::ReadFile(e.path() / "stat")) out.push_back(name);
  }
  return out;
}

class HostDiskRun : public RootTest {
 protected:
  void SetUp() override {
    disks_ = ReadableDisks();
    if (disks_.empty()) GTEST_SKIP() << "this machine has no disk whose /sys/block/<dev>/stat can be read";
    const auto boot_id = platform::ReadFile("/proc/sys/kernel/random/boot_id");
    if (!boot_id || boot_id->empty()) GTEST_SKIP() << "this machine has no boot id to choose the store's days by";
    // Days whose parity differs from the boot id's first hex digit write
    // the store's NAND keys (any other character counts as even).
    const char c = (*boot_id)[0];
    const int64_t x = c >= '0' && c <= '9' ? c : (c >= 'A' && c <= 'F' ? c + 1 : 10);
    store_day_ = kToday + ((x ^ kToday) & 1 ? 0 : 1);
    At(store_day_);
    const RunResult init = RunProgram(DEVSIM_BIN, {"init", root.path(), "--force", "--host"}, env);
    ASSERT_EQ(init.status, 0) << init.err;
  }
  void At(int32_t day) { env["TALLYRUN_NOW"] = std::to_string(int64_t{day} * 86400 + 15 * 3600); }

  // The day's NAND info keys in the store, or -1.
  int64_t Stored(int32_t day, const std::string& key) {
    const RunResult dump =
        RunProgram(TALLYBOOK_BIN, {"dump", "--day", std::to_string(day), "--prefix", key}, env);
    const std::string prefix = std::to_string(day) + " " + key + " ";
    for (size_t at = dump.out.find(prefix); at != std::string::npos; at = dump.out.find(prefix, at + 1))
      if (at == 0 || dump.out[at - 1] == '\n') return std::stoll(dump.out.substr(at + prefix.size()));
    return -1;
  }

  std::vector<std::string> disks_;
  int32_t store_day_ = 0;
};

TEST_F(HostDiskRun, TheDisksNumbersReachTheStore) {
  const cf::Value registry = ReadPlist(root / "device/registry.plist");
  ASSERT_TRUE(registry.AsArray());
  ASSERT_GE(registry.AsArray()->size(), 2u);  // the platform entry and the disks
  const cf::Dictionary& first = *(*registry.AsArray())[1].AsDictionary();
  EXPECT_EQ(*first.Get("userClient").AsString(), "host");
  EXPECT_EQ(first.Get("properties").AsDictionary()->Get("device").AsString()->rfind("/dev/", 0), 0u);
  for (const char* simulated : {"controller.plist", "sysctl.plist", "stackshot.plist", "ioreport.plist"})
    EXPECT_FALSE(platform::FileExists(root / (std::string("device/") + simulated))) << simulated;

  const RunResult r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "NANDInfo: CopyNANDInfoWithOptions: obtaining FTL data for TBKD"), 1u) << r.err;
  EXPECT_EQ(Count(r.err, "error reading nand info"), 0u) << r.err;
  EXPECT_GE(Stored(store_day_, "com.velmora.NANDInfo.NumLogicalWrites"), 0) << r.err;
  EXPECT_GE(Stored(store_day_, "com.velmora.NANDInfo.NumLogicalReads"), 0);
  EXPECT_EQ(Stored(store_day_, "com.velmora.NANDInfo.Error"), -1);

  // A disk that went away is no controller; the next disk, if any, is.
  cf::Array gone;
  for (size_t i = 0; i < registry.AsArray()->size(); ++i) {
    cf::Dictionary entry = (*registry.AsArray())[i].AsDictionary()->MutableCopy();
    cf::Dictionary properties;
    properties.Set("device", "/dev/tallyrun-no-such-disk");
    if (i == 1) entry.Set("properties", properties);
    gone.Append(entry);
  }
  WritePlist("device/registry.plist", gone);
  const RunResult again = Tallyrun({"-f"});
  EXPECT_EQ(Count(again.err, "the disk /dev/tallyrun-no-such-disk cannot be read (cannot open "
                             "/sys/block/tallyrun-no-such-disk/stat: No such file or directory); no controller there"),
            1u)
      << again.err;
  EXPECT_EQ(Count(again.err, "<error>"), 0u) << "a controller the machine lacks is no failure\n" << again.err;
}

TEST_F(HostDiskRun, WritesBetweenTwoStoreDaysShowAsGrowth) {
  struct statfs fs;
  ASSERT_EQ(statfs(root.path().c_str(), &fs), 0);
  if (fs.f_type == 0x01021994) GTEST_SKIP() << "the root is on tmpfs, which writes to no disk";
  ASSERT_EQ(Tallyrun({"-f"}).status, 0);
  const int64_t before = Stored(store_day_, "com.velmora.NANDInfo.NumLogicalWrites");
  ASSERT_GE(before, 0);

  // 8 MiB through the root's filesystem, on the disk before the next run.
  {
    const std::string path = root / "growth.bin";
    const int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    ASSERT_GE(fd, 0);
    std::string chunk(1 << 20, '\0');
    for (size_t i = 0; i < chunk.size(); ++i) chunk[i] = static_cast<char>(i * 131 + 7);
    for (int i = 0; i < 8; ++i) ASSERT_EQ(platform::WriteToDescriptor(fd, chunk), static_cast<ssize_t>(chunk.size()));
    ASSERT_EQ(fsync(fd), 0);
    close(fd);
  }

  At(store_day_ + 2);  // the same parity: a store day again
  const RunResult r = Tallyrun({"-f"});
  const int64_t after = Stored(store_day_ + 2, "com.velmora.NANDInfo.NumLogicalWrites");
  EXPECT_GT(after, before) << r.err;
}

}  // namespace
