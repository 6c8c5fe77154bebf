#include "platform/system.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>

#include "../../tests/temp_dir.h"
#include "cf/plist.h"
#include "platform/analytics.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/profile.h"
#include "platform/services.h"

namespace platform {
namespace {

class SystemTest : public ::testing::Test {
 protected:
  TempDir root;
  std::shared_ptr<FixedClock> clock = std::make_shared<FixedClock>(1795341600);
  std::shared_ptr<CaptureLog> log = std::make_shared<CaptureLog>();
  ContextScope scope{root.path(), Backends{clock, log}};

  void Write(const std::string& rel, const cf::Value& v) {
    std::string bytes;
    ASSERT_TRUE(cf::WriteXMLPropertyList(v, bytes, nullptr));
    ASSERT_TRUE(WriteFileAtomically(root / rel, bytes));
  }
  static void SetEnv(const char* name, const char* value) {
    if (value) setenv(name, value, 1);
    else unsetenv(name);
  }
};

TEST_F(SystemTest, KernelVariablesAndTheirSizes) {
  cf::Dictionary profile;
  profile.Set("kern.small", cf::Value::SInt64(7));
  profile.Set("kern.big", cf::Value::UInt64(0x1'0000'0000ull));
  profile.Set("kern.record", cf::Value::Bytes(cf::Data{1, 2, 3, 4, 5, 6}));
  profile.Set("vm.swapusage", cf::Value::Bytes(cf::Data(32, 0)));
  profile.Set("kern.bootsessionuuid", "8F0C");
  Write("device/sysctl.plist", profile);

  uint32_t u32 = 0;
  uint64_t u64 = 0;
  size_t size = 4;
  EXPECT_EQ(Sysctl("kern.small", &u32, &size), 0);
  EXPECT_EQ(u32, 7u);
  size = 8;
  EXPECT_EQ(Sysctl("kern.small", &u64, &size), 0);
  EXPECT_EQ(u64, 7u);
  size = 4;
  errno = 0;
  EXPECT_EQ(Sysctl("kern.big", &u32, &size), -1);  // does not fit 32 bits
  EXPECT_EQ(errno, ENOMEM);
  size = 8;
  EXPECT_EQ(Sysctl("kern.big", &u64, &size), 0);
  EXPECT_EQ(u64, 0x1'0000'0000ull);
  uint8_t record[6] = {};
  size = 6;
  EXPECT_EQ(Sysctl("kern.record", record, &size), 0);
  EXPECT_EQ(record[5], 6);
  // Bytes go into any buffer at least as large, the size becoming theirs.
  size = 8;
  EXPECT_EQ(Sysctl("kern.record", &u64, &size), 0);
  EXPECT_EQ(size, 6u);
  size = 5;
  EXPECT_EQ(Sysctl("kern.record", record, &size), -1);
  EXPECT_EQ(errno, ENOMEM);
  char text[100] = {'x'};
  size = sizeof text;
  EXPECT_EQ(Sysctl("kern.bootsessionuuid", text, &size), 0);
  EXPECT_EQ(size, 5u);  // the NUL counts
  EXPECT_STREQ(text, "8F0C");
  size = 4;
  EXPECT_EQ(Sysctl("kern.bootsessionuuid", text, &size), -1);
  EXPECT_EQ(errno, ENOMEM);
  size = 2;
  EXPECT_EQ(Sysctl("kern.small", &u32, &size), -1);
  size = 8;
  EXPECT_EQ(Sysctl("kern.unknown", &u64, &size), -1);
  EXPECT_EQ(errno, ENOENT);
  uint64_t swap[4] = {9, 9, 9, 9};
  size = 32;
  EXPECT_EQ(Sysctl("vm.swapusage", swap, &size), 0);  // the profile wins over Linux
  EXPECT_EQ(swap[0], 0u);

  // Without a profile: Linux's own swap total and boot id.
  ASSERT_TRUE(WriteFileAtomically(root / "device/sysctl.plist", "<plist version=\"1.0\"><dict/></plist>"));
  if (FileExists("/proc/meminfo")) {
    EXPECT_EQ(Sysctl("vm.swapusage", swap, &size), 0);
    size = 16;
    EXPECT_EQ(Sysctl("vm.swapusage", swap, &size), -1);
  }
  if (FileExists("/proc/sys/kernel/random/boot_id")) {
    char uuid[37] = {};
    size = sizeof uuid;
    EXPECT_EQ(Sysctl("kern.bootsessionuuid", uuid, &size), 0);
    EXPECT_EQ(std::string(uuid).size(), 36u);
  }
  EXPECT_GE(PageSize(), 4096u);
}

TEST_F(SystemTest, DeviceFilesAreReadOnlyWhenRegularAndSmall) {
  ASSERT_TRUE(MakeDirectories(root / "device"));
  // A FIFO must neither block the run nor be read.
  const std::string sysctl = root / "device/sysctl.plist";
  ASSERT_EQ(mkfifo(sysctl.c_str(), 0600), 0);
  uint64_t u64 = 0;
  size_t size = 8;
  for (int i = 0; i < 3; ++i) {
    errno = 0;
    EXPECT_EQ(Sysctl("kern.any", &u64, &size), -1);
    EXPECT_EQ(errno, ENOENT);
  }
  EXPECT_EQ(log->Count(sysctl + " is not a regular file; ignoring it"), 1u);

  // A device behind a link would never end.
  const std::string answers = root / "device/answers.plist";
  ASSERT_EQ(symlink("/dev/zero", answers.c_str()), 0);
  EXPECT_EQ(cf::Value(systemLanguages()), cf::Value(cf::Array({cf::Value("en")})));
  EXPECT_TRUE(ReadProfileDictionary("/device/answers.plist").empty());
  EXPECT_EQ(log->Count(answers + " is not a regular file; ignoring it"), 1u);

  // Up to 16 MiB is read; one byte more is refused, with one line however often it is asked for.
  auto apps_of_size = [&](size_t total) {
    const std::string head = "<plist version=\"1.0\"><array><dict><key>bundleIdentifier</key><string>";
    const std::string tail = "</string><key>bundleType</key><string>User</string></dict></array></plist>";
    ASSERT_TRUE(WriteFileAtomically(root / "device/apps.plist",
                                    head + std::string(total - head.size() - tail.size(), 'a') + tail));
  };
  auto app_ids = [] {
    std::vector<size_t> sizes;
    LSApplicationWorkspace::defaultWorkspace().enumerateBundlesOfType(
        1, [&](const LSBundleProxy& b) { sizes.push_back(b.bundleIdentifier.size()); });
    return sizes;
  };
  apps_of_size(16 << 20);
  ASSERT_EQ(app_ids().size(), 1u);
  apps_of_size((16 << 20) + 1);
  EXPECT_TRUE(app_ids().empty());
  EXPECT_TRUE(app_ids().empty());
  EXPECT_EQ(log->Count(root / "device/apps.plist is 16777217 bytes, over the limit of 16777216; ignoring it"), 1u);
  apps_of_size(17 << 20);
  EXPECT_TRUE(app_ids().empty());
  EXPECT_EQ(log->CountContaining("over the limit of 16777216"), 2u);
}

TEST_F(SystemTest, DeviceFileIsParsedOnceUntilItsStampChanges) {
  const std::string sysctl = root / "device/sysctl.plist";
  ASSERT_TRUE(WriteFileAtomically(sysctl, "not a property list"));
  uint64_t u64 = 0;
  size_t size = 8;
  for (int i = 0; i < 3; ++i) EXPECT_EQ(Sysctl("kern.v", &u64, &size), -1);
  const std::string bad = sysctl + " is not a property list (";
  EXPECT_EQ(log->CountContaining(bad), 1u);
  {
    ContextScope other(root.path(), Backends{clock, log});  // another context parses for itself
    EXPECT_EQ(Sysctl("kern.v", &u64, &size), -1);
    EXPECT_EQ(log->CountContaining(bad), 2u);
  }

  Write("device/sysctl.plist", cf::Array());
  for (int i = 0; i < 3; ++i) EXPECT_EQ(Sysctl("kern.v", &u64, &size), -1);
  EXPECT_EQ(log->Count(sysctl + " is an array, not a dictionary; ignoring it"), 1u);

  // Rewritten in place with the same size: the stamp's nanoseconds tell.
  auto rewrite = [&](int64_t value, timespec modified) {
    cf::Dictionary d;
    d.Set("kern.v", cf::Value::SInt64(value));
    std::string bytes;
    ASSERT_TRUE(cf::WriteXMLPropertyList(d, bytes, nullptr));
    const int fd = open(sysctl.c_str(), O_WRONLY | O_TRUNC);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(write(fd, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    const timespec times[2] = {modified, modified};
    ASSERT_EQ(futimens(fd, times), 0);
    close(fd);
  };
  auto read = [&] {
    u64 = 0;
    EXPECT_EQ(Sysctl("kern.v", &u64, &size), 0);
    return u64;
  };
  rewrite(1, {1'700'000'000, 0});
  EXPECT_EQ(read(), 1u);
  rewrite(2, {1'700'000'000, 0});
  EXPECT_EQ(read(), 1u);  // same stamp: the parse already made stands
  rewrite(2, {1'700'000'000, 1});
  EXPECT_EQ(read(), 2u);
  // Stamped just now, a second write can share the stamp of the first (the
  // file system's clock is coarse): then the content tells.
  timespec now;
  clock_gettime(CLOCK_REALTIME, &now);
  rewrite(3, now);
  EXPECT_EQ(read(), 3u);
  rewrite(4, now);
  EXPECT_EQ(read(), 4u);
  ASSERT_EQ(unlink(sysctl.c_str()), 0);
  EXPECT_EQ(Sysctl("kern.v", &u64, &size), -1);
  EXPECT_EQ(log->CountContaining(sysctl), 3u);  // no line for the good or missing file
}

TEST_F(SystemTest, TimebaseAppsAndVersion) {
  clock->AdvanceMonotonic(5);
  EXPECT_EQ(mach_absolute_time(), 1'000'000'005u);
  mach_timebase_info_data_t info{};
  EXPECT_EQ(mach_timebase_info(&info), 0);
  EXPECT_EQ(info.numer, 1u);
  EXPECT_EQ(info.denom, 1u);
  clock->SetTimebase(0, 0, false);
  EXPECT_NE(mach_timebase_info(&info), 0);

  int count = 0;
  LSApplicationWorkspace::defaultWorkspace().enumerateBundlesOfType(1, [&](const LSBundleProxy&) { ++count; });
  EXPECT_EQ(count, 0);  // no registry file: no apps
  cf::Dictionary user, system;
  user.Set("bundleIdentifier", "com.example.a");
  user.Set("bundleType", LSUserApplicationType);
  system.Set("bundleIdentifier", "com.velmora.b");
  system.Set("bundleType", "System");
  Write("device/apps.plist", cf::Array({user, system, cf::Value("not an app")}));
  std::vector<std::string> seen;
  LSApplicationWorkspace::defaultWorkspace().enumerateBundlesOfType(
      1, [&](const LSBundleProxy& b) { seen.push_back(b.bundleIdentifier + "/" + b.bundleType); });
  EXPECT_EQ(seen, (std::vector<std::string>{"com.example.a/User", "com.velmora.b/System"}));

  cf::Dictionary version;
  version.Set("ProductVersion", "4.2");
  version.Set("ProductBuildVersion", "22C41");
  Write("device/system-version.plist", version);
  EXPECT_EQ(_CFCopySystemVersionDictionary().AsDictionary()->Get("ProductBuildVersion"), cf::Value("22C41"));
}

TEST_F(SystemTest, Locale) {
  const std::string old_lang = EnvOr("LANG", ""), old_language = EnvOr("LANGUAGE", "");
  SetEnv("LANGUAGE", nullptr);
  SetEnv("LANG", "de_DE.UTF-8");
  EXPECT_EQ(cf::Value(preferredLanguages()), cf::Value(cf::Array({cf::Value("de-DE")})));
  EXPECT_EQ(CurrentLocaleCountryCode(), cf::Value("DE"));
  SetEnv("LANGUAGE", "fr_CA:en");
  EXPECT_EQ(cf::Value(preferredLanguages()), cf::Value(cf::Array({cf::Value("fr-CA"), cf::Value("en")})));
  SetEnv("LANG", "C.UTF-8");
  SetEnv("LANGUAGE", nullptr);
  EXPECT_TRUE(preferredLanguages().empty());
  EXPECT_TRUE(CurrentLocaleCountryCode().IsNull());
  SetEnv("LANG", "ja");
  EXPECT_TRUE(CurrentLocaleCountryCode().IsNull());

  EXPECT_EQ(cf::Value(systemLanguages()), cf::Value(cf::Array({cf::Value("en")})));
  const cf::Array available({cf::Value("en"), cf::Value("fr"), cf::Value("pt-BR"), cf::Value("pt-PT")});
  auto best = [&](std::initializer_list<cf::Value> prefs) {
    return cf::Value(preferredLocalizationsFromArray(available, cf::Array(std::vector<cf::Value>(prefs))));
  };
  EXPECT_EQ(best({"pt-PT"}), cf::Value(cf::Array({cf::Value("pt-PT")})));  // exact beats language
  EXPECT_EQ(best({"fr-CA", "en"}), cf::Value(cf::Array({cf::Value("fr")})));
  EXPECT_EQ(best({"pt"}), cf::Value(cf::Array({cf::Value("pt-BR")})));
  EXPECT_EQ(best({"xx", "en-GB"}), cf::Value(cf::Array({cf::Value("en")})));
  EXPECT_EQ(best({"xx"}), cf::Value(cf::Array()));
  SetEnv("LANG", old_lang.empty() ? nullptr : old_lang.c_str());
  SetEnv("LANGUAGE", old_language.empty() ? nullptr : old_language.c_str());
}

TEST_F(SystemTest, AnalyticsEvents) {
  int built = 0;
  auto payload = [&] {
    ++built;
    cf::Dictionary d;
    d.Set("n", cf::Value::SInt32(1));
    return cf::Value(d);
  };
  EXPECT_FALSE(AnalyticsIsEventUsed("e.one"));
  EXPECT_FALSE(AnalyticsSendEventLazy("e.one", payload));
  EXPECT_EQ(built, 0);  // an unused event never builds its payload
  Write("var/eventlens/enabled-events.plist", cf::Array({cf::Value("e.one")}));
  EXPECT_TRUE(AnalyticsIsEventUsed("e.one"));
  EXPECT_FALSE(AnalyticsIsEventUsed("e.two"));
  EXPECT_TRUE(AnalyticsSendEventLazy("e.one", payload));
  Write("var/eventlens/enabled-events.plist", cf::Value("*"));
  EXPECT_TRUE(AnalyticsSendEventLazy("e.two", payload));
  EXPECT_EQ(built, 2);
  EXPECT_EQ(*ReadFile(root / "var/eventlens/events.jsonl"),
            "{\"time\":\"2026-11-22T10:00:00Z\",\"event\":\"e.one\",\"payload\":{\"n\":1}}\n"
            "{\"time\":\"2026-11-22T10:00:00Z\",\"event\":\"e.two\",\"payload\":{\"n\":1}}\n");

  Backends without_analytics{clock, log};
  without_analytics.analytics_available = false;
  ContextScope weak(root.path(), without_analytics);
  EXPECT_FALSE(AnalyticsAvailable());
  EXPECT_FALSE(AnalyticsIsEventUsed("e.one"));
  EXPECT_FALSE(AnalyticsSendEventLazy("e.one", payload));
  EXPECT_EQ(built, 2);
}

TEST_F(SystemTest, ConfigurationAndOtherUsersPreferences) {
  auto& config = DGVSystemConfiguration::sharedInstance();
  config.setPrefsKey("k", cf::Value::SInt32(1), "com.velmora.x", true);
  EXPECT_TRUE(FileExists(root / "var/diagvault/config/com.velmora.x.plist"));
  config.setPrefsKey("k", cf::Value(), "com.velmora.x", false);  // removed, not yet written
  EXPECT_TRUE(config.getPrefsKey("k", "com.velmora.x", cf::Value()).IsNull());
  EXPECT_NE(ReadFile(root / "var/diagvault/config/com.velmora.x.plist")->find("<key>k</key>"), std::string::npos);

  auto& client = DGVServicesClient::sharedClient();
  EXPECT_TRUE(client.setPreference("volume", "guest", "com.velmora.audio", cf::Value::SInt32(3)));
  const std::string file = root / "var/users/guest/Library/Preferences/com.velmora.audio.plist";
  EXPECT_NE(ReadFile(file)->find("<integer>3</integer>"), std::string::npos);
  EXPECT_TRUE(client.deletePreference("volume", "guest", "com.velmora.audio"));
  EXPECT_EQ(ReadFile(file)->find("volume"), std::string::npos);
  EXPECT_FALSE(client.setPreference("k", "../escape", "d", cf::Value::SInt32(1)));
  EXPECT_FALSE(client.setPreference("k", "", "d", cf::Value::SInt32(1)));
  EXPECT_FALSE(client.setPreference("k", "..", "d", cf::Value::SInt32(1)));
}

}  // namespace
}  // namespace platform
