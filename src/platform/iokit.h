// The device registry and its user clients, under the names the system
// calls them by. Objects (services, iterators, connections) are small
// integer handles, counted by reference; a released or unknown handle fails
// cleanly with an error code. Behind the seam the simulated device answers
// from $ROOT/device/registry.plist and the files of each user-client kind.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "cf/value.h"
#include "sim/device.h"

using kern_return_t = sim::kern_return_t;
using IOReturn = sim::kern_return_t;
using io_object_t = uint32_t;
using io_service_t = io_object_t;
using io_registry_entry_t = io_object_t;
using io_iterator_t = io_object_t;
using io_connect_t = io_object_t;
using mach_port_t = uint32_t;
using task_port_t = uint32_t;
using mach_vm_address_t = uint64_t;
using mach_vm_size_t = uint64_t;

inline constexpr kern_return_t KERN_SUCCESS = 0;
using sim::kIOReturnBadArgument;
using sim::kIOReturnError;
using sim::kIOReturnNoDevice;
using sim::kIOReturnNoMemory;
using sim::kIOReturnNotFound;
using sim::kIOReturnNotOpen;
using sim::kIOReturnNotPrivileged;
using sim::kIOReturnSuccess;
using sim::kIOReturnUnsupported;

inline constexpr mach_port_t kIOMainPortDefault = 0;
inline constexpr const char* kIOServicePlane = "IOService";
inline constexpr uint32_t kIORegistryIterateRecursively = 1;
inline constexpr uint32_t kIORegistryIterateParents = 2;
inline constexpr uint32_t kIOMapAnywhere = 1;

task_port_t mach_task_self();

// {"IOProviderClass": name}, a new mutable dictionary.
cf::Value IOServiceMatching(std::string_view className);
// The first matching service (a new reference), or 0.
io_service_t IOServiceGetMatchingService(mach_port_t mainPort, const cf::Value& matching);
kern_return_t IOServiceGetMatchingServices(mach_port_t mainPort, const cf::Value& matching, io_iterator_t* existing);
// The next service (a new reference), or 0 at the end or once the registry
// has changed since the walk began.
io_object_t IOIteratorNext(io_iterator_t iterator);
bool IOIteratorIsValid(io_iterator_t iterator);
void IOIteratorReset(io_iterator_t iterator);

kern_return_t IOObjectRetain(io_object_t object);
kern_return_t IOObjectRelease(io_object_t object);

kern_return_t IORegistryEntryGetRegistryEntryID(io_registry_entry_t entry, uint64_t* entryID);
// Copies the entry's name into name (128 bytes with the NUL).
kern_return_t IORegistryEntryGetName(io_registry_entry_t entry, char* name);
// The property, or null.
cf::Value IORegistryEntryCreateCFProperty(io_registry_entry_t entry, std::string_view key);
// With kIORegistryIterateRecursively | kIORegistryIterateParents, the
// nearest parent's property when the entry has none.
cf::Value IORegistryEntrySearchCFProperty(io_registry_entry_t entry, std::string_view plane, std::string_view key,
                                          uint32_t options);

kern_return_t IOServiceOpen(io_service_t service, task_port_t owningTask, uint32_t type, io_connect_t* connect);
kern_return_t IOServiceClose(io_connect_t connect);

kern_return_t IOConnectCallMethod(io_connect_t connection, uint32_t selector, const uint64_t* input, uint32_t inputCnt,
                                  const void* inputStruct, size_t inputStructCnt, uint64_t* output,
                                  uint32_t* outputCnt, void* outputStruct, size_t* outputStructCnt);
kern_return_t IOConnectCallStructMethod(io_connect_t connection, uint32_t selector, const void* inputStruct,
                                        size_t inputStructCnt, void* outputStruct, size_t* outputStructCnt);
kern_return_t IOConnectCallScalarMethod(io_connect_t connection, uint32_t selector, const uint64_t* input,
                                        uint32_t inputCnt, uint64_t* output, uint32_t* outputCnt);
// Maps the client's memory of a type: *atAddress and *ofSize describe bytes
// that stay valid until the next call on the connection or its close.
kern_return_t IOConnectMapMemory64(io_connect_t connect, uint32_t memoryType, task_port_t intoTask,
                                   mach_vm_address_t* atAddress, mach_vm_size_t* ofSize, uint32_t options);
// Ends a mapping made by IOConnectMapMemory64. The bytes belong to the
// client, so this only checks that the connection is open.
kern_return_t IOConnectUnmapMemory64(io_connect_t connect, uint32_t memoryType, task_port_t fromTask,
                                     mach_vm_address_t atAddress);

namespace platform {
// How many objects are open in the current context (tests check for leaks).
size_t OpenIOObjectCount();
}  // namespace platform
