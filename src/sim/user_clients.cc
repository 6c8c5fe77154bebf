#include "sim/user_clients.h"

#include <deque>
#include <mutex>
#include <string>
#include <string_view>

namespace sim {

namespace {

struct Kind {
  std::string_view name;
  std::unique_ptr<UserClient> (*create)(const Service&, DeviceFiles&);
};

// One line per kind: the "userClient" value of registry.plist and its class.
constexpr Kind kKinds[] = {
    {"nvme", &CreateNvmeClient},
    {"hub", &CreateHubClient},
    {"ean", &CreateEanClient},
};

// Kinds registered from behind the seam; registration happens once, but a
// lookup may come from any thread that has a context. A deque keeps the
// records where they are while more are added.
struct Registered {
  std::string name;
  UserClientFactory create;
  ServiceAttacher attach;
};
std::mutex g_registered_mu;
std::deque<Registered>& RegisteredKinds() {
  static std::deque<Registered> kinds;
  return kinds;
}

const Registered* FindRegistered(std::string_view name) {
  std::lock_guard<std::mutex> lock(g_registered_mu);
  for (const Registered& kind : RegisteredKinds())
    if (kind.name == name) return &kind;
  return nullptr;
}

}  // namespace

std::unique_ptr<UserClient> CreateUserClient(const Service& service, DeviceFiles& files) {
  for (const Kind& kind : kKinds)
    if (kind.name == service.user_client) return kind.create(service, files);
  if (const Registered* kind = FindRegistered(service.user_client)) return kind->create(service, files);
  return nullptr;
}

void RegisterUserClientKind(std::string_view name, UserClientFactory create, ServiceAttacher attach) {
  if (FindRegistered(name)) return;
  std::lock_guard<std::mutex> lock(g_registered_mu);
  RegisteredKinds().push_back({std::string(name), create, attach});
}

ServiceAttacher AttacherOf(std::string_view kind) {
  const Registered* r = FindRegistered(kind);
  return r ? r->attach : nullptr;
}

}  // namespace sim
