#include "platform/iokit.h"

#include <sys/stat.h>

#include <algorithm>
#include <cstring>

#include "platform/context.h"
#include "platform/device_model.h"
#include "platform/host_disk.h"
#include "platform/log.h"
#include "platform/profile.h"

namespace platform {

namespace {

constexpr const char* kRegistryFile = "/device/registry.plist";

// The device files as the user clients see them: read under the seam's
// rules for device files, problems in the system log.
class RootDeviceFiles : public sim::DeviceFiles {
 public:
  cf::Value Read(std::string_view name) override { return ReadProfileValue("/device/" + std::string(name)); }
  void Complain(const std::string& text) override { LogError("device: %s", text); }
};

// What identifies a version of a file: a change of any part means it was
// replaced or written.
std::string Stamp(const std::string& path) {
  struct stat st;
  if (stat(path.c_str(), &st) != 0) return "absent";
  return std::to_string(st.st_mtim.tv_sec) + "." + std::to_string(st.st_mtim.tv_nsec) + "/" +
         std::to_string(st.st_size) + "/" + std::to_string(st.st_ino);
}

DeviceModel& Model() { return Context::Current().device(); }
using Kind = DeviceModel::Object::Kind;

uint32_t NewService(uint64_t id) {
  DeviceModel::Object o;
  o.kind = Kind::kService;
  o.service_id = id;
  return Model().Add(std::move(o));
}

// The registry entry behind a service handle, or null.
const sim::Service* EntryOf(io_registry_entry_t entry) {
  DeviceModel& model = Model();
  const DeviceModel::Object* o = model.Get(entry, Kind::kService);
  return o ? model.registry().Find(o->service_id) : nullptr;
}

}  // namespace

DeviceModel::DeviceModel() : files_(std::make_unique<RootDeviceFiles>()) { RegisterHostDiskKind(); }
DeviceModel::~DeviceModel() = default;

const sim::Registry& DeviceModel::registry() {
  const std::string stamp = Stamp(Context::Current().Path(kRegistryFile));
  if (!loaded_ || stamp != stamp_) {
    std::string error;
    registry_ = sim::Registry::Load(ReadProfileValue(kRegistryFile), &error);
    if (!error.empty()) LogError("%s: %s; the device has no services", Context::Current().Path(kRegistryFile), error);
    // A disk that cannot be read is a controller this machine lacks: worth
    // a notice, not a failed run.
    for (const std::string& left_out : registry_.AttachDevices())
      LogDefault("%s: service %s", Context::Current().Path(kRegistryFile), left_out);
    stamp_ = stamp;
    loaded_ = true;
    ++generation_;
  }
  return registry_;
}

uint32_t DeviceModel::Add(Object object) {
  const uint32_t handle = next_handle_++;
  objects_.emplace(handle, std::move(object));
  return handle;
}

DeviceModel::Object* DeviceModel::Get(uint32_t handle) {
  auto it = objects_.find(handle);
  return it == objects_.end() ? nullptr : &it->second;
}

DeviceModel::Object* DeviceModel::Get(uint32_t handle, Object::Kind kind) {
  Object* o = Get(handle);
  return o && o->kind == kind ? o : nullptr;
}

size_t OpenIOObjectCount() { return Model().size(); }

}  // namespace platform

using platform::DeviceModel;
using platform::Model;
using Kind = DeviceModel::Object::Kind;

task_port_t mach_task_self() { return 1; }

cf::Value IOServiceMatching(std::string_view className) {
  cf::Dictionary matching;
  matching.Set("IOProviderClass", std::string(className));
  return matching;
}

io_service_t IOServiceGetMatchingService(mach_port_t, const cf::Value& matching) {
  const std::vector<uint64_t> ids = Model().registry().Match(matching);
  return ids.empty() ? 0 : platform::NewService(ids.front());
}

kern_return_t IOServiceGetMatchingServices(mach_port_t, const cf::Value& matching, io_iterator_t* existing) {
  if (!existing) return kIOReturnBadArgument;
  DeviceModel& model = Model();
  DeviceModel::Object o;
  o.kind = Kind::kIterator;
  o.matches = model.registry().Match(matching);
  o.generation = model.generation();
  *existing = model.Add(std::move(o));
  return kIOReturnSuccess;
}

bool IOIteratorIsValid(io_iterator_t iterator) {
  DeviceModel& model = Model();
  DeviceModel::Object* it = model.Get(iterator, Kind::kIterator);
  if (!it) return false;
  model.registry();  // notices a changed file
  return it->generation == model.generation();
}

io_object_t IOIteratorNext(io_iterator_t iterator) {
  DeviceModel& model = Model();
  if (!IOIteratorIsValid(iterator)) return 0;
  DeviceModel::Object* it = model.Get(iterator, Kind::kIterator);
  if (it->position >= it->matches.size()) return 0;
  return platform::NewService(it->matches[it->position++]);
}

void IOIteratorReset(io_iterator_t iterator) {
  DeviceModel& model = Model();
  if (DeviceModel::Object* it = model.Get(iterator, Kind::kIterator)) {
    it->position = 0;
    model.registry();
    it->generation = model.generation();
  }
}

kern_return_t IOObjectRetain(io_object_t object) {
  DeviceModel::Object* o = Model().Get(object);
  if (!o) return kIOReturnBadArgument;
  ++o->references;
  return kIOReturnSuccess;
}

kern_return_t IOObjectRelease(io_object_t object) {
  DeviceModel& model = Model();
  DeviceModel::Object* o = model.Get(object);
  if (!o || o->kind == Kind::kConnection) return kIOReturnBadArgument;  // connections end with IOServiceClose
  if (--o->references == 0) model.Remove(object);
  return kIOReturnSuccess;
}

kern_return_t IORegistryEntryGetRegistryEntryID(io_registry_entry_t entry, uint64_t* entryID) {
  const DeviceModel::Object* o = Model().Get(entry, Kind::kService);
  if (!o || !entryID) return kIOReturnBadArgument;
  *entryID = o->service_id;
  return kIOReturnSuccess;
}

kern_return_t IORegistryEntryGetName(io_registry_entry_t entry, char* name) {
  if (!name) return kIOReturnBadArgument;
  const sim::Service* s = platform::EntryOf(entry);
  if (!s) return Model().Get(entry, Kind::kService) ? kIOReturnNoDevice : kIOReturnBadArgument;
  const size_t n = std::min<size_t>(s->name.size(), 127);
  std::memcpy(name, s->name.data(), n);
  name[n] = '\0';
  return kIOReturnSuccess;
}

cf::Value IORegistryEntryCreateCFProperty(io_registry_entry_t entry, std::string_view key) {
  const DeviceModel::Object* o = Model().Get(entry, Kind::kService);
  return o ? Model().registry().Property(o->service_id, key, false) : cf::Value();
}

cf::Value IORegistryEntrySearchCFProperty(io_registry_entry_t entry, std::string_view, std::string_view key,
                                          uint32_t options) {
  const DeviceModel::Object* o = Model().Get(entry, Kind::kService);
  const bool parents = (options & kIORegistryIterateRecursively) && (options & kIORegistryIterateParents);
  return o ? Model().registry().Property(o->service_id, key, parents) : cf::Value();
}

kern_return_t IOServiceOpen(io_service_t service, task_port_t, uint32_t, io_connect_t* connect) {
  if (!connect) return kIOReturnBadArgument;
  *connect = 0;
  DeviceModel& model = Model();
  const DeviceModel::Object* o = model.Get(service, Kind::kService);
  if (!o) return kIOReturnBadArgument;
  const sim::Service* s = model.registry().Find(o->service_id);
  if (!s) return kIOReturnNoDevice;
  if (!s->openable) return kIOReturnNotPrivileged;
  std::unique_ptr<sim::UserClient> client = sim::CreateUserClient(*s, model.files());
  if (!client) return kIOReturnUnsupported;
  DeviceModel::Object c;
  c.kind = Kind::kConnection;
  c.service_id = s->id;
  c.client = std::move(client);
  c.close_fails = s->close_fails;
  *connect = model.Add(std::move(c));
  return kIOReturnSuccess;
}

kern_return_t IOServiceClose(io_connect_t connect) {
  DeviceModel& model = Model();
  const DeviceModel::Object* c = model.Get(connect, Kind::kConnection);
  if (!c) return kIOReturnBadArgument;
  const bool fails = c->close_fails;
  model.Remove(connect);  // gone either way; a failing close only says so
  return fails ? kIOReturnError : kIOReturnSuccess;
}

kern_return_t IOConnectCallMethod(io_connect_t connection, uint32_t selector, const uint64_t* input, uint32_t inputCnt,
                                  const void* inputStruct, size_t inputStructCnt, uint64_t* output,
                                  uint32_t* outputCnt, void* outputStruct, size_t* outputStructCnt) {
  DeviceModel::Object* c = Model().Get(connection, Kind::kConnection);
  if (!c) return kIOReturnBadArgument;
  sim::MethodCall call;
  call.selector = selector;
  call.scalar_in = input;
  call.scalar_in_count = input ? inputCnt : 0;
  call.struct_in = inputStruct;
  call.struct_in_size = inputStruct ? inputStructCnt : 0;
  uint32_t no_scalars = 0;
  size_t no_bytes = 0;
  call.scalar_out = output;
  call.scalar_out_count = output && outputCnt ? outputCnt : &no_scalars;
  call.struct_out = outputStruct;
  call.struct_out_size = outputStruct && outputStructCnt ? outputStructCnt : &no_bytes;
  return c->client->CallMethod(call);
}

kern_return_t IOConnectCallStructMethod(io_connect_t connection, uint32_t selector, const void* inputStruct,
                                        size_t inputStructCnt, void* outputStruct, size_t* outputStructCnt) {
  return IOConnectCallMethod(connection, selector, nullptr, 0, inputStruct, inputStructCnt, nullptr, nullptr,
                             outputStruct, outputStructCnt);
}

kern_return_t IOConnectCallScalarMethod(io_connect_t connection, uint32_t selector, const uint64_t* input,
                                        uint32_t inputCnt, uint64_t* output, uint32_t* outputCnt) {
  return IOConnectCallMethod(connection, selector, input, inputCnt, nullptr, 0, output, outputCnt, nullptr, nullptr);
}

kern_return_t IOConnectMapMemory64(io_connect_t connect, uint32_t memoryType, task_port_t, mach_vm_address_t* atAddress,
                                   mach_vm_size_t* ofSize, uint32_t) {
  DeviceModel::Object* c = Model().Get(connect, Kind::kConnection);
  if (!c || !atAddress || !ofSize) return kIOReturnBadArgument;
  std::string_view bytes;
  const kern_return_t rc = c->client->MapMemory(memoryType, &bytes);
  if (rc != kIOReturnSuccess) return rc;
  *atAddress = reinterpret_cast<mach_vm_address_t>(bytes.data());
  *ofSize = bytes.size();
  return kIOReturnSuccess;
}

kern_return_t IOConnectUnmapMemory64(io_connect_t connect, uint32_t, task_port_t, mach_vm_address_t) {
  return Model().Get(connect, Kind::kConnection) ? kIOReturnSuccess : kIOReturnBadArgument;
}
