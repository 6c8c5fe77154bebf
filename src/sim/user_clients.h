// The user-client kinds of the simulated device, one factory each.
#pragma once

#include <memory>

#include "sim/device.h"

namespace sim {

std::unique_ptr<UserClient> CreateNvmeClient(const Service& service, DeviceFiles& files);
std::unique_ptr<UserClient> CreateHubClient(const Service& service, DeviceFiles& files);
std::unique_ptr<UserClient> CreateEanClient(const Service& service, DeviceFiles& files);

// The attach step a registered kind gave, or null.
ServiceAttacher AttacherOf(std::string_view kind);

}  // namespace sim
