// TBConfig: the key whitelist. Loads
// /Library/Application Support/Tallybook/Whitelist_boxOS.plist, merges the key
// groups that are switched on, and answers which keys the report may carry
// and with which options.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "cf/value.h"

inline constexpr const char* kWhitelistPath = "/Library/Application Support/Tallybook/Whitelist_boxOS.plist";
inline constexpr const char* kKeyGroupSwitchDomain = "com.velmora.da";

// The device's "InternalBuild" answer, asked once and remembered.
bool TBIsInternalDevice();

class TBConfig {
 public:
  // Null when the whitelist cannot be read or parsed.
  static std::unique_ptr<TBConfig> init();

  // The key's options (possibly empty), or nothing when it is not listed.
  std::optional<cf::Dictionary> configOptionsForScalarKey(const std::string& key) const;
  std::optional<cf::Dictionary> configOptionsForDistributionKey(const std::string& key) const;
  // MD5 of the file's bytes as 32 lower-case hexadecimal digits.
  const std::string& configFileDigest() const { return _configFileDigest; }

 private:
  TBConfig() = default;
  std::optional<cf::Dictionary> Lookup(const cf::Dictionary& exact, const cf::Dictionary& prefixes,
                                       const std::string& key) const;
  void LoadGroup(const std::string& group_name, const cf::Dictionary& group);

  cf::Dictionary _scalarKeys;
  cf::Dictionary _scalarPrefixes;
  cf::Dictionary _distributionKeys;
  cf::Dictionary _distributionPrefixes;
  bool _isInternalDevice = false;
  std::string _configFileDigest;
};
