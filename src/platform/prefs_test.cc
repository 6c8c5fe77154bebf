#include "platform/prefs.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "../../tests/temp_dir.h"
#include "cf/plist.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"

namespace platform {
namespace {

constexpr const char* kDomain = "com.velmora.tallybookd.tallyrun";

class PrefsTest : public ::testing::Test {
 protected:
  TempDir root;
  std::shared_ptr<CaptureLog> log = std::make_shared<CaptureLog>();
  ContextScope scope{root.path(), Backends{nullptr, log}};
  std::string file = root / "Library/Preferences/com.velmora.tallybookd.tallyrun.plist";
};

TEST_F(PrefsTest, SetIsVisibleAtOnceAndSynchronizeWritesTheDomain) {
  EXPECT_TRUE(DGVPreferencesGetValue("LastOSVersion", kDomain).IsNull());
  DGVPreferencesSetValue("LastOSVersion", "1.0 (A1)", kDomain);
  DGVPreferencesSetValue("Gate", cf::Value::SInt32(20000), kDomain);
  EXPECT_EQ(DGVPreferencesGetValue("LastOSVersion", kDomain), cf::Value("1.0 (A1)"));
  EXPECT_FALSE(FileExists(file));
  ASSERT_TRUE(DGVPreferencesSynchronize(kDomain));
  const auto parsed = cf::ParsePropertyList(*ReadFile(file));
  ASSERT_TRUE(parsed.ok());
  EXPECT_EQ(parsed.value.AsDictionary()->Get("Gate"), cf::Value::SInt32(20000));

  // A removal, and a second writer (another process) whose keys survive ours.
  Preferences other(root / "Library/Preferences");
  other.Set(kDomain, "FromOther", cf::Value::Bool(true));
  ASSERT_TRUE(other.Synchronize(kDomain));
  DGVPreferencesSetValue("LastOSVersion", cf::Value(), kDomain);
  EXPECT_TRUE(DGVPreferencesGetValue("LastOSVersion", kDomain).IsNull());
  ASSERT_TRUE(DGVPreferencesSynchronize(kDomain));
  const cf::Dictionary on_disk = *cf::ParsePropertyList(*ReadFile(file)).value.AsDictionary();
  EXPECT_FALSE(on_disk.Contains("LastOSVersion"));
  EXPECT_EQ(on_disk.Get("FromOther"), cf::Value::Bool(true));
  EXPECT_EQ(on_disk.Get("Gate"), cf::Value::SInt32(20000));

  // Returned containers are copies: changing one does not change the store.
  cf::Dictionary payload;
  payload.Set("a", cf::Value::SInt32(1));
  DGVPreferencesSetValue("Payload", payload, kDomain);
  payload.Set("b", cf::Value::SInt32(2));
  cf::Value got = DGVPreferencesGetValue("Payload", kDomain);
  EXPECT_EQ(got.AsDictionary()->size(), 1u);
  cf::Dictionary handle = *got.AsDictionary();
  handle.Set("c", cf::Value::SInt32(3));
  EXPECT_EQ(DGVPreferencesGetValue("Payload", kDomain).AsDictionary()->size(), 1u);
}

TEST_F(PrefsTest, ExistenceFlags) {
  DGVPreferencesSetValue("n", cf::Value::SInt64(-5), kDomain);
  DGVPreferencesSetValue("b", cf::Value::Bool(true), kDomain);
  DGVPreferencesSetValue("s", "12", kDomain);
  DGVPreferencesSetValue("junk", "twelve", kDomain);
  DGVPreferencesSetValue("f", cf::Value::Float64(2.9), kDomain);
  bool exists = true;
  EXPECT_EQ(DGVPreferencesGetIntegerValue("missing", kDomain, &exists), 0);
  EXPECT_FALSE(exists);
  EXPECT_EQ(DGVPreferencesGetIntegerValue("missing", kDomain), 0);
  EXPECT_EQ(DGVPreferencesGetIntegerValue("n", kDomain, &exists), -5);
  EXPECT_TRUE(exists);
  EXPECT_EQ(DGVPreferencesGetIntegerValue("b", kDomain), 1);
  EXPECT_EQ(DGVPreferencesGetIntegerValue("s", kDomain, &exists), 12);
  EXPECT_TRUE(exists);
  EXPECT_EQ(DGVPreferencesGetIntegerValue("junk", kDomain, &exists), 0);
  EXPECT_FALSE(exists);
  EXPECT_EQ(DGVPreferencesGetIntegerValue("f", kDomain), 2);

  // The boolean flag is only ever set, never cleared.
  bool flag = false;
  EXPECT_FALSE(DGVPreferencesGetBoolValue("missing", kDomain, &flag));
  EXPECT_FALSE(flag);
  EXPECT_FALSE(DGVPreferencesGetBoolValue("s", kDomain, &flag));  // a string is not a boolean
  EXPECT_FALSE(flag);
  flag = true;
  EXPECT_FALSE(DGVPreferencesGetBoolValue("junk", kDomain, &flag));
  EXPECT_TRUE(flag);
  flag = false;
  EXPECT_TRUE(DGVPreferencesGetBoolValue("b", kDomain, &flag));
  EXPECT_TRUE(flag);
  flag = false;
  EXPECT_TRUE(DGVPreferencesGetBoolValue("n", kDomain, &flag));
  EXPECT_TRUE(flag);
  DGVPreferencesSetValue("zero", cf::Value::Float64(0.0), kDomain);
  flag = false;
  EXPECT_FALSE(DGVPreferencesGetBoolValue("zero", kDomain, &flag));
  EXPECT_TRUE(flag);

  bool valid = true;
  EXPECT_FALSE(CFPreferencesGetAppBooleanValue("s", kDomain, &valid));
  EXPECT_FALSE(valid);
  EXPECT_TRUE(CFPreferencesGetAppBooleanValue("b", kDomain, &valid));
  EXPECT_TRUE(valid);
  UserDefaultsSetValue("SSLastLoggedAt", cf::Value::SInt64(99));
  ASSERT_TRUE(UserDefaultsSynchronize());
  EXPECT_TRUE(FileExists(root / "Library/Preferences/tallyrun.plist"));
}

TEST_F(PrefsTest, BadFileReadsEmptyWithOneErrorAndIsOnlyReplacedByAWrite) {
  ASSERT_TRUE(WriteFileAtomically(file, "this is not a property list"));
  EXPECT_TRUE(DGVPreferencesGetValue("a", kDomain).IsNull());
  EXPECT_EQ(DGVPreferencesGetIntegerValue("a", kDomain), 0);
  EXPECT_EQ(log->CountContaining("is not a property-list dictionary"), 1u);
  EXPECT_TRUE(DGVPreferencesSynchronize(kDomain));  // nothing pending: nothing written
  EXPECT_EQ(*ReadFile(file), "this is not a property list");

  // An array root is as bad as garbage.
  const std::string array_file = root / "Library/Preferences/com.velmora.da.plist";
  ASSERT_TRUE(WriteFileAtomically(array_file, "<plist version=\"1.0\"><array/></plist>"));
  EXPECT_TRUE(DGVPreferencesGetValue("g", "com.velmora.da").IsNull());
  EXPECT_EQ(log->CountContaining("(root is an array)"), 1u);

  DGVPreferencesSetValue("a", cf::Value::SInt32(1), kDomain);
  ASSERT_TRUE(DGVPreferencesSynchronize(kDomain));
  EXPECT_EQ(cf::ParsePropertyList(*ReadFile(file)).value.AsDictionary()->Get("a"), cf::Value::SInt32(1));

  // Names that would escape the preferences directory are refused.
  DGVPreferencesSetValue("a", cf::Value::SInt32(1), "../escape");
  EXPECT_FALSE(DGVPreferencesSynchronize("../escape"));
  EXPECT_TRUE(DGVPreferencesGetValue("a", "").IsNull());
  EXPECT_FALSE(FileExists(root / "Library/escape.plist"));
}

TEST_F(PrefsTest, AValueTheFileCannotHoldIsRefusedAndTheDomainIsStillWritten) {
  cf::Dictionary nested_bad_string;
  nested_bad_string.Set("Value", cf::Array({cf::Value("ok"), cf::Value("bell\x07")}));
  cf::Dictionary bad_inner_key;
  bad_inner_key.Set("\xff\xfe", cf::Value::SInt32(1));
  cf::Dictionary number_inner_key;
  number_inner_key.Set(cf::Value::SInt32(5), "five");
  struct Case {
    cf::Value key;
    cf::Value value;
    const char* line;
  };
  const Case cases[] = {
      {"Payload", nested_bad_string,
       "Not setting preference Payload of domain com.velmora.tallybookd.tallyrun: string cannot be written to a "
       "property list: control character U+0007 at byte 4"},
      {"Inner", bad_inner_key,
       "Not setting preference Inner of domain com.velmora.tallybookd.tallyrun: key cannot be written to a property "
       "list: invalid UTF-8 at byte 0"},
      {"Numbered", number_inner_key,
       "Not setting preference Numbered of domain com.velmora.tallybookd.tallyrun: dictionary key of type number "
       "cannot be written to a property list"},
      {"Holes", cf::Array({cf::Value::SInt32(1), cf::Value()}),
       "Not setting preference Holes of domain com.velmora.tallybookd.tallyrun: null cannot be written to a property "
       "list"},
      {"Nonchar", "\xef\xbf\xbf",
       "Not setting preference Nonchar of domain com.velmora.tallybookd.tallyrun: string cannot be written to a "
       "property list: noncharacter U+FFFF at byte 0"},
      {"Key\x01", cf::Value::SInt32(1),
       "Not setting preference (unprintable key) of domain com.velmora.tallybookd.tallyrun: key cannot be written to "
       "a property list: control character U+0001 at byte 3"},
      {cf::Value::SInt32(7), cf::Value::SInt32(1),
       "Not setting preference 7 of domain com.velmora.tallybookd.tallyrun: the key is a number, not a string"},
  };
  DGVPreferencesSetValue("Payload", "the good one", kDomain);
  DGVPreferencesSetValue("LastCrashLogSerializationDateInDaysSince1970", cf::Value::SInt32(20778), kDomain);
  for (const Case& c : cases) {
    log->Clear();
    DGVPreferencesSetValue(c.key, c.value, kDomain);
    EXPECT_EQ(log->Count(c.line), 1u) << c.line << "\n" << (log->lines().empty() ? "" : log->lines()[0].text);
  }
  // What was set before stays visible, and the domain is still written.
  EXPECT_EQ(DGVPreferencesGetValue("Payload", kDomain), cf::Value("the good one"));
  ASSERT_TRUE(DGVPreferencesSynchronize(kDomain));
  const cf::Value on_disk = cf::ParsePropertyList(*ReadFile(file)).value;
  ASSERT_NE(on_disk.AsDictionary(), nullptr);
  EXPECT_EQ(on_disk.AsDictionary()->size(), 2u);
  EXPECT_EQ(on_disk.AsDictionary()->Get("LastCrashLogSerializationDateInDaysSince1970"), cf::Value::SInt32(20778));

  // The store object answers for itself; a removal (null) is always fine.
  Preferences direct(root / "Library/Preferences");
  EXPECT_FALSE(direct.Set(kDomain, "Payload", nested_bad_string));
  EXPECT_TRUE(direct.Set(kDomain, "Payload", cf::Value()));
  EXPECT_TRUE(direct.Synchronize(kDomain));
  EXPECT_FALSE(cf::ParsePropertyList(*ReadFile(file)).value.AsDictionary()->Contains("Payload"));
}

TEST(PrefsExitTest, PendingChangesAreWrittenAtNormalExit) {
  TempDir root;
  const pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    setenv("TALLYRUN_ROOT", root.path().c_str(), 1);
    if (Context::Current().root() != root.path()) _exit(4);
    DGVPreferencesSetValue("Pending", cf::Value::SInt32(7), kDomain);
    exit(0);  // normal exit: the pending value must reach the disk
  }
  int status = 0;
  waitpid(child, &status, 0);
  ASSERT_TRUE(WIFEXITED(status));
  ASSERT_EQ(WEXITSTATUS(status), 0);
  const auto bytes = ReadFile(root / "Library/Preferences/com.velmora.tallybookd.tallyrun.plist");
  ASSERT_TRUE(bytes.has_value());
  EXPECT_EQ(cf::ParsePropertyList(*bytes).value.AsDictionary()->Get("Pending"), cf::Value::SInt32(7));
}

}  // namespace
}  // namespace platform
