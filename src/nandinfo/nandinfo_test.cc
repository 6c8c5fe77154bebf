#include "nandinfo/nandinfo.h"

#include <gtest/gtest.h>

#include <thread>

#include "../../tests/temp_dir.h"
#include "../../tests/test_values.h"
#include "cf/plist.h"
#include "nandinfo/controller.h"
#include "parsers/context.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "sim/kcdata.h"

namespace {

class NANDInfoTest : public ::testing::Test {
 protected:
  TempDir root;
  std::shared_ptr<platform::FixedClock> clock = std::make_shared<platform::FixedClock>(20000 * 86400.0 + 3600);
  std::shared_ptr<platform::CaptureLog> log = std::make_shared<platform::CaptureLog>();
  platform::Backends backends{clock, log};
  std::unique_ptr<platform::ContextScope> scope = std::make_unique<platform::ContextScope>(root.path(), backends);

  void SetUp() override {
    parsers::testing::ResetAPIErrorMessage();
    nandinfo::testing::ResetControllerState();
  }
  void Write(const std::string& name, const cf::Value& v) {
    std::string bytes;
    ASSERT_TRUE(cf::WriteXMLPropertyList(v, bytes, nullptr));
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
    ASSERT_TRUE(platform::WriteFileAtomically(root / ("device/" + name), bytes));
  }
};

TEST_F(NANDInfoTest, AnalyticsDaysFollowTheBootSessionAndTheDay) {
  // The four cases that fix the rule: the hex digit's parity against the day's.
  EXPECT_FALSE(IsEventLensDay('7', 20000 * 86400LL));
  EXPECT_TRUE(IsEventLensDay('8', 20000 * 86400LL));
  EXPECT_FALSE(IsEventLensDay('a', 20001 * 86400LL));  // lower case counts as 10
  EXPECT_TRUE(IsEventLensDay('B', 20001 * 86400LL + 86399));
  EXPECT_TRUE(IsEventLensDay('-', 20000 * 86400LL));

  // Options 0 on an analytics day send the two views and return nothing;
  // on the other days the store dictionary comes back (here its error form).
  Write("sysctl.plist", Dict({{"kern.bootsessionuuid", "8C0FFEE"}}));
  EXPECT_TRUE(CopyNANDInfoWithOptions(0).IsNull());
  EXPECT_EQ(log->Count("NANDInfo: CopyNANDInfoWithOptions: returning EL dictionary"), 1u);
  EXPECT_EQ(log->Count("NANDInfo: CopyNANDInfoWithOptions: logging MSP big view to EL"), 1u);
  EXPECT_EQ(log->Count("NANDInfo: CopyNANDInfoWithOptions: logging FTL big views to EL"), 0u);
  Write("sysctl.plist", Dict({{"kern.bootsessionuuid", "7C0FFEE"}}));
  const cf::Value tbkd = CopyNANDInfoWithOptions(1);
  ASSERT_NE(tbkd.AsDictionary(), nullptr);
  EXPECT_EQ(tbkd.AsDictionary()->Get("com.velmora.NANDInfo.Error"), cf::Value("1"));
  EXPECT_EQ(tbkd.AsDictionary()->Get("com.velmora.NANDInfo.ErrorMessage"), cf::Value("Unable to parse buffer"));
  EXPECT_EQ(log->Count("NANDInfo: CopyNANDInfoWithOptions: returning TBKD dictionary"), 1u);
}

TEST_F(NANDInfoTest, DerivedFiguresAndTheFreezersWrites) {
  cf::Dictionary usage = Dict({{"TotalDiskCapacity", cf::Value::SInt64(250000000000)},  // sold as 256 GB
                               {"TotalDataAvailable", cf::Value::SInt64(64LL << 30)}});
  Write("answers.plist", Dict({{"DiskUsage", usage}}));
  Write("purgeable.plist", Dict({{"PURGEWELL_TOTAL_AVAILABLE", cf::Value::SInt64(5)},
                                 {"PURGEWELL_NONPURGEABLE_AMOUNT", cf::Value::SInt64(6)}}));
  cf::Array threads({Dict({{"name", "VM_swapout"}, {"diskWrites", cf::Value::UInt64(4096)}})});
  Write("stackshot.plist", cf::Array({Dict({{"name", "kernel_task"}, {"threads", threads}})}));
  cf::Dictionary ftl = Dict({{"userPartitionStart", cf::Value::UInt64(36864)},
                             {"intermediatePartitionStart", cf::Value::UInt64(4096)},
                             {"utilFormatTime", cf::Value::UInt64(946684800 + 604800)},
                             {"hostWrites", cf::Value::UInt64(77)},
                             {"numBootBlockRefreshSuccess_3", cf::Value::UInt64(5)},
                             {"numBootBlockRefreshFail_3", cf::Value::UInt64(4)},
                             {"numBootBlockRefreshSuccess_5", cf::Value::UInt64(8)},
                             {"mspBootBlockCountPerMsp", cf::Value::UInt64(4)},
                             {"mspBootBlockReadFails_4", cf::Value::UInt64(2)},
                             {"mspBootBlockReadFails_5", cf::Value::UInt64(3)}});
  const cf::Dictionary esr = gatherVSPFTLOtherData(ftl);
  EXPECT_EQ(esr.Get("ESR_Purgewell_totalPurgeable"), cf::Value::SInt64(5));
  EXPECT_EQ(esr.Get("ESR_Purgewell_totalNonPurgeable"), cf::Value::SInt64(6));
  EXPECT_EQ(esr.Get("ESR_VMFreezer_bytesWritten"), cf::Value::UInt64(4096));
  EXPECT_EQ(esr.Get("com.velmora.NANDInfo.VMFreezer.NumPhysicalWrites"), cf::Value::UInt64(4096));
  EXPECT_EQ(esr.Get("ESR_DV_Capacity_GB"), cf::Value::UInt64(256));
  EXPECT_EQ(esr.Get("ESR_DV_Diskfullness_BP"), cf::Value::SInt64(2748));  // 65536 of 238418 MiB
  EXPECT_EQ(esr.Get("ESR_storeDemoMode"), cf::Value::SInt32(0));
  EXPECT_EQ(esr.Get("ESR_intermediatePartitionSize"), cf::Value::SInt64(32768));
  EXPECT_EQ(esr.Get("ESR_formatWeeksSince2000"), cf::Value::SInt64(1));
  EXPECT_EQ(esr.Get("ESR_hostWrites"), cf::Value::UInt64(77));
  EXPECT_FALSE(esr.Contains("ESR_averageSLCPECycles"));
  EXPECT_EQ(esr.Get("ESR_numBootBlockRefreshes_max"), cf::Value::SInt64(9));
  EXPECT_EQ(esr.Get("ESR_mspBootBlockReadFails_main"), cf::Value::SInt64(2));
  EXPECT_EQ(esr.Get("ESR_mspBootBlockReadFails_backup"), cf::Value::SInt64(3));
  EXPECT_EQ(esr.Get("ESR_mspBootBlockEraseFails_main"), cf::Value::SInt64(0));
  EXPECT_EQ(GetAPIErrorMessage(), "NA");

  // Without an FTL dictionary, a disk answer or the services: what is left.
  Write("answers.plist", Dict({{"DiskUsage", cf::Value::Bool(false)}}));
  Write("purgeable.plist", Dict({{"com.velmora.NANDInfo.Purgewell.Error", cf::Value::SInt32(1)},
                                 {"PURGEWELL_TOTAL_AVAILABLE", cf::Value::SInt64(5)}}));
  Write("stackshot.plist", cf::Array({Dict({{"name", "other"}, {"threads", threads}})}));  // the thread, but in no first container
  const cf::Dictionary bare = gatherVSPFTLOtherData(cf::Value());
  EXPECT_EQ(bare.Get("ESR_DV_Capacity_GB"), cf::Value::UInt64(0));  // capacity unknown (-1)
  EXPECT_FALSE(bare.Contains("ESR_DV_Diskfullness_BP"));
  EXPECT_FALSE(bare.Contains("ESR_Purgewell_totalPurgeable"));
  EXPECT_FALSE(bare.Contains("ESR_numBootBlockRefreshes_max"));
  EXPECT_EQ(GetAPIErrorMessage(), "gatherVSPFTLOtherData: ftlDict is NULL");

  backends.purgewell_available = false;
  scope.reset();
  scope = std::make_unique<platform::ContextScope>(root.path(), backends);
  EXPECT_TRUE(getPurgewellInfo().empty());

  // The freezer's thread without I/O statistics counts 0; no stackshot, nothing.
  platform::WriteFileAtomically(root / "device/stackshot.kcdata",
                                sim::KCDataBuilder().Begin(1, 1).Begin(2).ThreadName("VM_swapout").End(2).End(1).bytes());
  EXPECT_EQ(CopyVMFreezerNANDInfo().Get("ESR_VMFreezer_bytesWritten"), cf::Value::UInt64(0));
  std::remove((root / "device/stackshot.kcdata").c_str());
  std::remove((root / "device/stackshot.plist").c_str());
  EXPECT_TRUE(CopyVMFreezerNANDInfo().empty());
}

}  // namespace
