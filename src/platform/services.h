// Diagnostics services the tasking writes through: the diagnostics system
// configuration and the services client that sets other users' preferences.
#pragma once

#include <string_view>

#include "cf/value.h"

// One property-list file per domain in $ROOT/var/diagvault/config/.
class DGVSystemConfiguration {
 public:
  static DGVSystemConfiguration& sharedInstance();
  cf::Value getPrefsKey(const cf::Value& key, std::string_view domain, const cf::Value& options);
  // A null value removes the key; withSync writes the domain at once.
  void setPrefsKey(const cf::Value& key, const cf::Value& value, std::string_view domain, bool withSync);
};

// Preferences of a named user, in $ROOT/var/users/<user>/Library/Preferences/,
// written at once.
class DGVServicesClient {
 public:
  static DGVServicesClient& sharedClient();
  bool setPreference(const cf::Value& key, std::string_view user, std::string_view domain, const cf::Value& value);
  bool deletePreference(const cf::Value& key, std::string_view user, std::string_view domain);
};

// The scheduled tasking's home in the diagnostics configuration.
inline constexpr const char* kScheduledTaskingDomain = "com.velmora.OTAFerrowin";
