// The per-context state of the device registry (internal to the seam): the
// registry as last loaded and the table of open handles.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "sim/device.h"

namespace platform {

class DeviceModel {
 public:
  struct Object {
    enum class Kind { kService, kIterator, kConnection };
    Kind kind = Kind::kService;
    int references = 1;
    uint64_t service_id = 0;                     // a service, or the service a connection was opened on
    std::vector<uint64_t> matches;               // an iterator's services
    size_t position = 0;                         // an iterator's next match
    uint64_t generation = 0;                     // the registry an iterator walks
    std::unique_ptr<sim::UserClient> client;     // a connection's
    bool close_fails = false;                    // a connection's
  };

  DeviceModel();
  ~DeviceModel();

  // The registry, loaded again when registry.plist has changed.
  const sim::Registry& registry();
  uint64_t generation() const { return generation_; }
  sim::DeviceFiles& files() { return *files_; }

  uint32_t Add(Object object);
  Object* Get(uint32_t handle);
  Object* Get(uint32_t handle, Object::Kind kind);
  void Remove(uint32_t handle) { objects_.erase(handle); }
  size_t size() const { return objects_.size(); }

 private:
  sim::Registry registry_;
  std::string stamp_;  // of the registry.plist loaded
  bool loaded_ = false;
  uint64_t generation_ = 0;
  std::unique_ptr<sim::DeviceFiles> files_;
  std::map<uint32_t, Object> objects_;
  uint32_t next_handle_ = 1;
};

}  // namespace platform
