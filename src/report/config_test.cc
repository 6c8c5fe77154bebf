#include "report/config.h"

#include <gtest/gtest.h>

#include "../../tests/temp_dir.h"
#include "cf/plist.h"
#include "platform/context.h"
#include "platform/diagnostics.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/prefs.h"

namespace {

cf::Dictionary D(std::initializer_list<std::pair<const char*, cf::Value>> entries) {
  return cf::Dictionary::Of(entries);
}

class ConfigTest : public ::testing::Test {
 protected:
  TempDir root;
  std::shared_ptr<platform::CaptureLog> log = std::make_shared<platform::CaptureLog>();
  platform::ContextScope scope{root.path(), platform::Backends{nullptr, log}};

  void WriteWhitelist(const std::string& bytes) {
    ASSERT_TRUE(platform::WriteFileAtomically(scope.context().Path(kWhitelistPath), bytes));
  }
  void WriteWhitelist(const cf::Value& v) {
    std::string bytes;
    ASSERT_TRUE(cf::WriteXMLPropertyList(v, bytes, nullptr));
    WriteWhitelist(bytes);
  }
  void SetInternal(bool internal) {
    std::string bytes;
    cf::WriteXMLPropertyList(D({{"InternalBuild", cf::Value::Bool(internal)}}), bytes, nullptr);
    platform::WriteFileAtomically(scope.context().Path("/device/answers.plist"), bytes);
  }
  static std::string Hex(const std::string& raw) {
    std::string out;
    for (unsigned char c : raw) out += cf::Format("%02x", c);
    return out;
  }
};

cf::Dictionary Sample() {
  const cf::Dictionary ten = D({{"bucket_interval", cf::Value::SInt64(10)}});
  const cf::Dictionary two = D({{"sig_fig", cf::Value::SInt64(2)}});
  return D({
      {"Base", D({{"ScalarKeys", D({{"a.exact", ten}, {"a.shared", ten}})},
                  {"ScalarKeyPrefixes", D({{"a.", two}, {"a.ex", cf::Dictionary()}})},
                  {"DistributionKeys", D({{"d.one", D({{"intervals", cf::Array()}})}})},
                  {"Unknown", D({{"x", cf::Dictionary()}})}})},
      {"Later", D({{"ScalarKeys", D({{"a.shared", two}})}})},
      {"Switched", D({{"ScalarKeys", D({{"s.key", cf::Dictionary()}})}})},
      {"InternalTesting", D({{"ScalarKeyPrefixes", D({{"debug.", cf::Dictionary()}})}})},
  });
}

TEST_F(ConfigTest, ExactBeforePrefixLaterGroupsWinAndSwitchesApply) {
  WriteWhitelist(Sample());
  DGVPreferencesSetValue("Switched", cf::Value::Bool(false), kKeyGroupSwitchDomain);
  DGVPreferencesSetValue("Later", cf::Value::Bool(true), kKeyGroupSwitchDomain);
  auto config = TBConfig::init();
  ASSERT_NE(config, nullptr);
  EXPECT_EQ(cf::Value(*config->configOptionsForScalarKey("a.exact")), cf::Value(D({{"bucket_interval", cf::Value::SInt64(10)}})));
  EXPECT_EQ(cf::Value(*config->configOptionsForScalarKey("a.shared")), cf::Value(D({{"sig_fig", cf::Value::SInt64(2)}})));
  // The first prefix in enumeration order wins, not the longest.
  EXPECT_EQ(cf::Value(*config->configOptionsForScalarKey("a.extra")), cf::Value(D({{"sig_fig", cf::Value::SInt64(2)}})));
  EXPECT_EQ(log->Count("prefix match a. for a.extra"), 1u);
  EXPECT_FALSE(config->configOptionsForScalarKey("A.extra"));  // case matters
  EXPECT_FALSE(config->configOptionsForScalarKey("a"));
  EXPECT_FALSE(config->configOptionsForScalarKey("d.one"));  // kinds are separate
  EXPECT_TRUE(config->configOptionsForDistributionKey("d.one"));
  EXPECT_FALSE(config->configOptionsForScalarKey("s.key"));
  EXPECT_EQ(log->Count("keyGroup Switched is disabled by tasking"), 1u);
  EXPECT_FALSE(config->configOptionsForScalarKey("debug.x"));  // internal group skipped, silently
  EXPECT_EQ(log->CountContaining("InternalTesting"), 0u);
  EXPECT_EQ(config->configFileDigest(), Hex(CC_MD5(*platform::ReadFile(scope.context().Path(kWhitelistPath)))));
}

TEST_F(ConfigTest, InternalDevicesGetEveryKey) {
  WriteWhitelist(Sample());
  SetInternal(true);
  DGVPreferencesSetValue("Switched", cf::Value::Bool(false), kKeyGroupSwitchDomain);
  auto config = TBConfig::init();
  ASSERT_NE(config, nullptr);
  EXPECT_TRUE(config->configOptionsForScalarKey("s.key"));   // switch ignored
  EXPECT_TRUE(config->configOptionsForScalarKey("debug.x"));  // internal group loaded
  const auto unlisted = config->configOptionsForDistributionKey("nowhere");
  ASSERT_TRUE(unlisted);
  EXPECT_TRUE(unlisted->empty());
  EXPECT_EQ(log->Count("passing @{} for nowhere as device is Velmora Internal"), 1u);
  EXPECT_EQ(log->CountContaining("disabled by tasking"), 0u);
}

TEST_F(ConfigTest, MissingBadAndMistypedWhitelists) {
  EXPECT_EQ(TBConfig::init(), nullptr);
  EXPECT_EQ(log->Count("Couldn't load whitelist"), 1u);

  WriteWhitelist(std::string("<plist><dict><key>x</key>"));
  EXPECT_EQ(TBConfig::init(), nullptr);
  EXPECT_EQ(log->Count("Couldn't parse the contents of the config file. Error: malformed XML property list"), 1u);

  // The same content in another encoding has another digest.
  WriteWhitelist(Sample());
  const std::string xml_digest = TBConfig::init()->configFileDigest();
  std::string bin;
  ASSERT_TRUE(cf::WriteBinaryPropertyList(Sample(), bin, nullptr));
  WriteWhitelist(bin);
  auto binary = TBConfig::init();
  ASSERT_NE(binary, nullptr);
  EXPECT_TRUE(binary->configOptionsForScalarKey("a.exact"));
  EXPECT_NE(binary->configFileDigest(), xml_digest);
  EXPECT_EQ(binary->configFileDigest().size(), 32u);

  // Parts of the wrong type are treated as absent, one error line each.
  log->Clear();
  WriteWhitelist(D({
      {"NotAGroup", cf::Value::SInt32(3)},
      {"BadSection", D({{"ScalarKeys", cf::Array()}, {"DistributionKeys", D({{"ok.d", cf::Dictionary()}})}})},
      {"BadEntry", D({{"ScalarKeys", D({{"bad.key", cf::Value("options")}, {"good.key", cf::Dictionary()}})}})},
  }));
  auto config = TBConfig::init();
  ASSERT_NE(config, nullptr);
  EXPECT_EQ(log->Count("Whitelist group NotAGroup is a number, not a dictionary; ignoring it"), 1u);
  EXPECT_EQ(log->Count("Whitelist section ScalarKeys of group BadSection is an array, not a dictionary; ignoring it"), 1u);
  EXPECT_EQ(log->CountContaining("Whitelist entry bad.key in section ScalarKeys of group BadEntry"), 1u);
  EXPECT_TRUE(config->configOptionsForDistributionKey("ok.d"));
  EXPECT_TRUE(config->configOptionsForScalarKey("good.key"));
  EXPECT_FALSE(config->configOptionsForScalarKey("bad.key"));

  WriteWhitelist(cf::Value(cf::Array()));
  config = TBConfig::init();
  ASSERT_NE(config, nullptr);  // an unusable root lists nothing, but the digest is still known
  EXPECT_FALSE(config->configOptionsForScalarKey("good.key"));
  EXPECT_EQ(config->configFileDigest().size(), 32u);
  EXPECT_EQ(log->Count("Whitelist root is an array, not a dictionary; ignoring it"), 1u);
}

}  // namespace
