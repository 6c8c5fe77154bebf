#include "platform/services.h"

#include "platform/context.h"
#include "platform/log.h"
#include "platform/prefs.h"

namespace {

constexpr const char* kConfigDir = "/var/diagvault/config";

platform::Preferences* UserPreferences(std::string_view user) {
  if (!platform::IsValidPreferenceDomain(user) || user == "..") {
    platform::LogError("Invalid user name \"%s\"", std::string(user));
    return nullptr;
  }
  return &platform::Context::Current().PreferencesAt("/var/users/" + std::string(user) + "/Library/Preferences");
}

}  // namespace

DGVSystemConfiguration& DGVSystemConfiguration::sharedInstance() {
  static DGVSystemConfiguration instance;
  return instance;
}

cf::Value DGVSystemConfiguration::getPrefsKey(const cf::Value& key, std::string_view domain, const cf::Value&) {
  return platform::Context::Current().PreferencesAt(kConfigDir).Get(domain, key);
}

void DGVSystemConfiguration::setPrefsKey(const cf::Value& key, const cf::Value& value, std::string_view domain,
                                         bool withSync) {
  platform::Preferences& config = platform::Context::Current().PreferencesAt(kConfigDir);
  config.Set(domain, key, value);
  if (withSync) config.Synchronize(domain);
}

DGVServicesClient& DGVServicesClient::sharedClient() {
  static DGVServicesClient client;
  return client;
}

bool DGVServicesClient::setPreference(const cf::Value& key, std::string_view user, std::string_view domain,
                                      const cf::Value& value) {
  platform::Preferences* prefs = UserPreferences(user);
  if (!prefs) return false;
  prefs->Set(domain, key, value);
  return prefs->Synchronize(domain);
}

bool DGVServicesClient::deletePreference(const cf::Value& key, std::string_view user, std::string_view domain) {
  return setPreference(key, user, domain, cf::Value());
}
