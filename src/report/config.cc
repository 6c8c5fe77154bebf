#include "report/config.h"

#include "cf/plist.h"
#include "platform/context.h"
#include "platform/diagnostics.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/prefs.h"

using platform::LogDebug;
using platform::LogDefault;
using platform::LogError;

bool TBIsInternalDevice() {
  // Once per process; a new context (a test's root) asks again.
  static uint64_t asked_for = 0;
  static bool answer = false;
  if (asked_for != platform::Context::Current().id()) {
    answer = DVGetBoolAnswer("InternalBuild");
    asked_for = platform::Context::Current().id();
  }
  return answer;
}

std::unique_ptr<TBConfig> TBConfig::init() {
  std::unique_ptr<TBConfig> config(new TBConfig());
  config->_isInternalDevice = TBIsInternalDevice();

  const auto bytes = platform::ReadFile(platform::Context::Current().Path(kWhitelistPath));
  if (!bytes) {
    LogError("Couldn't load whitelist");
    return nullptr;
  }
  // The digest describes the bytes as read, whatever parsing makes of them.
  static const char* kHex = "0123456789abcdef";
  const std::string md5 = CC_MD5(*bytes);
  config->_configFileDigest.reserve(32);
  for (unsigned char c : md5) {
    config->_configFileDigest += kHex[c >> 4];
    config->_configFileDigest += kHex[c & 15];
  }

  const cf::ParseResult parsed = cf::ParsePropertyList(*bytes);
  if (!parsed.ok()) {
    LogError("Couldn't parse the contents of the config file. Error: %@", cf::Value(parsed.error));
    return nullptr;
  }
  const cf::Dictionary* root = parsed.value.AsDictionary();
  if (!root) {
    LogError("Whitelist root is %s, not a dictionary; ignoring it", cf::TypeNameWithArticle(parsed.value.type()));
    return config;
  }
  for (const auto& [name_value, group_value] : *root) {
    const cf::String* name = name_value.AsString();
    if (!name) {
      LogError("Whitelist group name %@ is not a string; ignoring the group", name_value);
      continue;
    }
    if (*name == "InternalTesting" && !config->_isInternalDevice) continue;
    bool exists = false;
    const bool enabled = DGVPreferencesGetBoolValue(*name, kKeyGroupSwitchDomain, &exists);
    if (!(enabled || config->_isInternalDevice || !exists)) {
      LogDefault("keyGroup %@ is disabled by tasking", name_value);
      continue;
    }
    const cf::Dictionary* group = group_value.AsDictionary();
    if (!group) {
      LogError("Whitelist group %s is %s, not a dictionary; ignoring it", *name, cf::TypeNameWithArticle(group_value.type()));
      continue;
    }
    config->LoadGroup(*name, *group);
  }
  return config;
}

void TBConfig::LoadGroup(const std::string& group_name, const cf::Dictionary& group) {
  for (const auto& [section_name, section_value] : group) {
    const cf::String* section = section_name.AsString();
    cf::Dictionary* table = nullptr;
    if (!section) continue;
    if (*section == "ScalarKeys") table = &_scalarKeys;
    else if (*section == "DistributionKeys") table = &_distributionKeys;
    else if (*section == "ScalarKeyPrefixes") table = &_scalarPrefixes;
    else if (*section == "DistributionKeyPrefixes") table = &_distributionPrefixes;
    else continue;
    const cf::Dictionary* entries = section_value.AsDictionary();
    if (!entries) {
      LogError("Whitelist section %s of group %s is %s, not a dictionary; ignoring it", *section, group_name,
               cf::TypeNameWithArticle(section_value.type()));
      continue;
    }
    for (const auto& [key, options] : *entries) {
      if (!key.AsString() || !options.AsDictionary()) {
        LogError("Whitelist entry %@ in section %s of group %s is not a key with an options dictionary; ignoring it",
                 key, *section, group_name);
        continue;
      }
      table->Set(key, options);
    }
  }
}

std::optional<cf::Dictionary> TBConfig::Lookup(const cf::Dictionary& exact, const cf::Dictionary& prefixes,
                                               const std::string& key) const {
  if (const cf::Value* options = exact.Find(key)) return *options->AsDictionary();
  for (const auto& [prefix, options] : prefixes) {
    const std::string& p = *prefix.AsString();
    if (key.compare(0, p.size(), p) == 0) {
      LogDebug("prefix match %@ for %@", prefix, cf::Value(key));
      return *options.AsDictionary();
    }
  }
  if (_isInternalDevice) {
    LogDebug("passing @{} for %@ as device is Velmora Internal", cf::Value(key));
    return cf::Dictionary();
  }
  return std::nullopt;
}

std::optional<cf::Dictionary> TBConfig::configOptionsForScalarKey(const std::string& key) const {
  return Lookup(_scalarKeys, _scalarPrefixes, key);
}

std::optional<cf::Dictionary> TBConfig::configOptionsForDistributionKey(const std::string& key) const {
  return Lookup(_distributionKeys, _distributionPrefixes, key);
}
