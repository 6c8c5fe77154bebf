// Preference domains: one XML property-list file per domain at
// $ROOT/Library/Preferences/<domain>.plist.
//
// A set is visible at once in this process; synchronize merges the pending
// changes into the file as it is on disk and replaces it atomically. Pending
// changes of the process's own context are also written at normal exit.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <string_view>

#include "cf/value.h"

namespace platform {

class Preferences {
 public:
  explicit Preferences(std::string directory);
  ~Preferences();

  cf::Value Get(std::string_view domain, const cf::Value& key);
  // A null value removes the key. Refuses (false, with an error line) a key
  // that is not a string or a value the property-list writer cannot store:
  // kept pending, it would keep the whole domain from being written.
  bool Set(std::string_view domain, const cf::Value& key, cf::Value value);
  bool Synchronize(std::string_view domain);
  void SynchronizeAll();
  std::string PathFor(std::string_view domain) const;

 private:
  struct Domain {
    cf::Dictionary on_disk;
    // What was on disk when on_disk was read, to notice other writers.
    int64_t mtime_ns = -1;
    int64_t size = -1;
    uint64_t inode = 0;
    bool bad_file_reported = false;
    cf::Dictionary pending;  // key -> value, or null for a removal
  };
  Domain* Load(std::string_view domain);

  std::string directory_;
  std::map<std::string, Domain, std::less<>> domains_;
};

// Domain names become file names: they must not be empty, contain '/' or
// start with '.'.
bool IsValidPreferenceDomain(std::string_view domain);

}  // namespace platform

// ---- the system's preference calls, over the current context ----

cf::Value DGVPreferencesGetValue(const cf::Value& key, std::string_view domain);
// Refuses what Preferences::Set refuses; the rest of the domain is unaffected.
void DGVPreferencesSetValue(const cf::Value& key, const cf::Value& value, std::string_view domain);
// A missing key gives 0. *exists (when given) tells whether the key held a
// number, a boolean or a numeric string.
int64_t DGVPreferencesGetIntegerValue(const cf::Value& key, std::string_view domain, bool* exists = nullptr);
// *exists (when given) is set only when the key holds a boolean or a number;
// otherwise it is left as the caller set it.
bool DGVPreferencesGetBoolValue(const cf::Value& key, std::string_view domain, bool* exists = nullptr);
bool DGVPreferencesSynchronize(std::string_view domain);

cf::Value CFPreferencesCopyAppValue(const cf::Value& key, std::string_view application);
bool CFPreferencesGetAppBooleanValue(const cf::Value& key, std::string_view application,
                                     bool* valid = nullptr);

// The process's standard user defaults (domain "tallyrun").
inline constexpr std::string_view kStandardUserDefaultsDomain = "tallyrun";
cf::Value UserDefaultsGetValue(const cf::Value& key);
void UserDefaultsSetValue(const cf::Value& key, const cf::Value& value);
bool UserDefaultsSynchronize();
