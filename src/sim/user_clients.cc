#include "sim/user_clients.h"

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

}  // namespace

std::unique_ptr<UserClient> CreateUserClient(const Service& service, DeviceFiles& files) {
  for (const Kind& kind : kKinds)
    if (kind.name == service.user_client) return kind.create(service, files);
  return nullptr;
}

}  // namespace sim
