// The simulated device's registry and user clients. The registry is data
// (services loaded from a property list); the user clients are code, one
// small class per kind. Everything here is pure: the platform seam hands in
// the contents of the device files and owns the handles.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "cf/value.h"

namespace sim {

// Return codes of the registry and its user clients.
using kern_return_t = int32_t;
inline constexpr kern_return_t kIOReturnSuccess = 0;
inline constexpr kern_return_t kIOReturnError = static_cast<kern_return_t>(0xE00002BC);
inline constexpr kern_return_t kIOReturnNoMemory = static_cast<kern_return_t>(0xE00002BD);
inline constexpr kern_return_t kIOReturnNoDevice = static_cast<kern_return_t>(0xE00002C0);
inline constexpr kern_return_t kIOReturnNotPrivileged = static_cast<kern_return_t>(0xE00002C1);
inline constexpr kern_return_t kIOReturnBadArgument = static_cast<kern_return_t>(0xE00002C2);
inline constexpr kern_return_t kIOReturnUnsupported = static_cast<kern_return_t>(0xE00002C7);
inline constexpr kern_return_t kIOReturnNotOpen = static_cast<kern_return_t>(0xE00002CD);
inline constexpr kern_return_t kIOReturnNotFound = static_cast<kern_return_t>(0xE00002F0);

// One service of registry.plist.
struct Service {
  std::string class_name;
  std::string name;
  uint64_t id = 0;  // registry entry ID
  std::optional<uint64_t> parent;
  cf::Dictionary properties;
  std::string user_client;  // the kind that answers IOServiceOpen; empty: none
  bool openable = true;
  bool close_fails = false;
};

class Registry {
 public:
  // Services from the registry.plist value: an array of {"class", "name",
  // "id", "parent", "properties", "userClient", "openable", "closeFails"}.
  // A malformed entry makes the whole registry empty, with the reason in
  // *error: a device is described correctly or not at all.
  static Registry Load(const cf::Value& plist, std::string* error);

  const std::vector<Service>& services() const { return services_; }
  const Service* Find(uint64_t id) const;
  // Matching dictionary: "IOProviderClass" (a class name, matched exactly),
  // "IONameMatch" (the service's name) and "IOPropertyMatch" (a dictionary
  // whose every entry the service's properties hold with an equal value).
  // The IDs of every matching service, in registry order.
  std::vector<uint64_t> Match(const cf::Value& matching) const;
  // The property of the service, or, when recursive, of the nearest parent
  // that has it.
  cf::Value Property(uint64_t id, std::string_view key, bool recursive) const;
  // Lets each service whose kind registered an attach step complete itself
  // from its device (see RegisterUserClientKind); a service whose device is
  // absent leaves the registry. One line per service left out, saying why.
  std::vector<std::string> AttachDevices();

 private:
  std::vector<Service> services_;
};

// How a user client reads the device files that describe its answers (the
// platform reads them under its rules) and reports what it cannot use.
class DeviceFiles {
 public:
  virtual ~DeviceFiles() = default;
  // The parsed property list at device/<name>; null when absent or bad.
  virtual cf::Value Read(std::string_view name) = 0;
  // A problem with the device files that a person should see.
  virtual void Complain(const std::string& text) = 0;
};

// The arguments of one method call; counts and sizes are in/out.
struct MethodCall {
  uint32_t selector = 0;
  const uint64_t* scalar_in = nullptr;
  uint32_t scalar_in_count = 0;
  const void* struct_in = nullptr;
  size_t struct_in_size = 0;
  uint64_t* scalar_out = nullptr;
  uint32_t* scalar_out_count = nullptr;  // capacity in, count out
  void* struct_out = nullptr;
  size_t* struct_out_size = nullptr;  // capacity in, bytes out
};

class UserClient {
 public:
  virtual ~UserClient() = default;
  virtual kern_return_t CallMethod(MethodCall& call) = 0;
  // Memory of a type shared with the caller: its bytes stay valid until the
  // next call on this client or its close. Unsupported by default.
  virtual kern_return_t MapMemory(uint32_t type, std::string_view* bytes) {
    (void)type;
    (void)bytes;
    return kIOReturnUnsupported;
  }
};

// The user client of the service's kind, or null when the kind is unknown
// (the open then fails). Each kind registers itself in user_clients.cc.
std::unique_ptr<UserClient> CreateUserClient(const Service& service, DeviceFiles& files);

// Kinds that answer from the real machine live behind the platform seam and
// register here, once, before the registry is used. attach (may be null)
// runs when the registry loads: it adds the properties the device reports
// to the service, or returns false with the reason in *why when the device
// cannot be read, and the service is then left out as if it were absent.
using UserClientFactory = std::unique_ptr<UserClient> (*)(const Service&, DeviceFiles&);
using ServiceAttacher = bool (*)(Service& service, std::string* why);
void RegisterUserClientKind(std::string_view name, UserClientFactory create, ServiceAttacher attach);

}  // namespace sim
