#include "platform/host_disk.h"

#include <fcntl.h>
#include <libnvme.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <mutex>

#include "platform/files.h"
#include "platform/log.h"
#include "sim/device.h"
#include "sim/statistics_buffers.h"

namespace platform {

namespace {

std::mutex g_sysfs_mu;
std::string g_sysfs_base;  // empty: /sys

std::string Sysfs() {
  std::lock_guard<std::mutex> lock(g_sysfs_mu);
  return g_sysfs_base.empty() ? "/sys" : g_sysfs_base;
}

bool AllDigits(std::string_view s) {
  return !s.empty() && std::all_of(s.begin(), s.end(), [](char c) { return c >= '0' && c <= '9'; });
}

// "nvme0": an NVMe controller's character device.
bool IsNvmeController(std::string_view name) { return name.substr(0, 4) == "nvme" && AllDigits(name.substr(4)); }

// The controller of a namespace's block device ("nvme0n1" -> "nvme0"), or "".
std::string NvmeControllerOf(std::string_view name) {
  if (name.substr(0, 4) != "nvme") return "";
  const size_t n = name.find('n', 4);
  if (n == std::string_view::npos || !AllDigits(name.substr(4, n - 4)) || !AllDigits(name.substr(n + 1))) return "";
  return std::string(name.substr(0, n));
}

// NAME of "/dev/NAME", or "" when device is not such a path.
std::string DeviceName(const std::string& device) {
  if (device.rfind("/dev/", 0) != 0) return "";
  const std::string name = device.substr(5);
  if (name.empty() || name == "." || name == ".." || name.find('/') != std::string::npos) return "";
  return name;
}

std::vector<std::string> SortedEntries(const std::string& dir) {
  std::vector<std::string> names;
  std::error_code ec;
  for (std::filesystem::directory_iterator it(dir, ec), end; !ec && it != end; it.increment(ec))
    names.push_back(it->path().filename().string());
  std::sort(names.begin(), names.end());
  return names;
}

// The block devices whose statistics make up the disk: itself, or the
// namespaces of an NVMe controller.
std::vector<std::string> BlockDevicesOf(const std::string& name) {
  if (!IsNvmeController(name)) return {name};
  std::vector<std::string> out;
  for (const std::string& entry : SortedEntries(Sysfs() + "/class/nvme/" + name))
    if (entry.rfind(name + "n", 0) == 0 && AllDigits(std::string_view(entry).substr(name.size() + 1)))
      out.push_back(entry);
  return out;
}

std::string SysfsText(const std::string& path) {
  const auto text = ReadFile(path);
  return text ? TrimmedText(*text) : "";
}

// The first of the files that holds text.
std::string FirstText(std::initializer_list<std::string> paths) {
  for (const std::string& p : paths)
    if (std::string t = SysfsText(p); !t.empty()) return t;
  return "";
}

// The open NVMe controller of a disk, when it has one that can be opened.
class NvmeController {
 public:
  explicit NvmeController(const std::string& name) {
    std::string controller = IsNvmeController(name) ? name : NvmeControllerOf(name);
    if (!controller.empty()) fd_ = open(("/dev/" + controller).c_str(), O_RDONLY | O_CLOEXEC);
  }
  ~NvmeController() {
    if (fd_ >= 0) close(fd_);
  }
  NvmeController(const NvmeController&) = delete;
  NvmeController& operator=(const NvmeController&) = delete;

  std::optional<NvmeHealth> Health() {
    if (fd_ < 0) return std::nullopt;
    nvme_smart_log page;
    std::memset(&page, 0, sizeof page);
    if (nvme_get_log_smart(fd_, NVME_NSID_ALL, false, &page) != 0) return std::nullopt;
    return DecodeNvmeHealthPage(std::string_view(reinterpret_cast<const char*>(&page), sizeof page));
  }
  std::optional<DiskIdentity> Identity() {
    if (fd_ < 0) return std::nullopt;
    nvme_id_ctrl data;
    std::memset(&data, 0, sizeof data);
    if (nvme_identify_ctrl(fd_, &data) != 0) return std::nullopt;
    return DecodeNvmeIdentifyController(std::string_view(reinterpret_cast<const char*>(&data), sizeof data));
  }

 private:
  int fd_ = -1;
};

// The user client of one disk. The size phase reads the disk and keeps the
// buffer for the data phase, so both phases agree on its length.
class HostDiskClient : public sim::UserClient {
 public:
  explicit HostDiskClient(const sim::Service& service)
      : tunnel_method_(service.class_name == "VSPStorage" ? 8 : 9) {
    if (const cf::String* d = service.properties.Get("device").AsString()) device_ = *d;
  }

  sim::kern_return_t CallMethod(sim::MethodCall& call) override {
    if (call.selector != tunnel_method_) return sim::kIOReturnUnsupported;
    if (call.struct_in_size != 24 || !call.struct_in || !call.struct_out_size) return sim::kIOReturnBadArgument;
    uint32_t command, flags;
    std::memcpy(&command, call.struct_in, 4);
    std::memcpy(&flags, static_cast<const char*>(call.struct_in) + 4, 4);
    if (command != 13) return sim::kIOReturnUnsupported;  // the statistics are all a disk can tell
    const bool size_phase = flags & 1;
    if (size_phase || !buffer_) {
      std::string why;
      buffer_ = HostDiskStatisticsBuffer(device_, &why);
      if (!buffer_) {
        if (!complained_) LogError("host disk %s can no longer be read: %s", device_, why);
        complained_ = true;
        return sim::kIOReturnNoDevice;
      }
    }
    if (size_phase) {
      if (*call.struct_out_size < 4 || !call.struct_out) return sim::kIOReturnBadArgument;
      const uint32_t size = static_cast<uint32_t>(buffer_->size());
      std::memcpy(call.struct_out, &size, 4);
      *call.struct_out_size = 4;
      return sim::kIOReturnSuccess;
    }
    const size_t n = std::min(*call.struct_out_size, buffer_->size());
    if (n > 0 && !call.struct_out) return sim::kIOReturnBadArgument;
    if (n > 0) std::memcpy(call.struct_out, buffer_->data(), n);
    *call.struct_out_size = n;
    buffer_.reset();
    return sim::kIOReturnSuccess;
  }

 private:
  const uint32_t tunnel_method_;
  std::string device_;
  std::optional<std::string> buffer_;
  bool complained_ = false;
};

std::unique_ptr<sim::UserClient> CreateHostDiskClient(const sim::Service& service, sim::DeviceFiles&) {
  return std::make_unique<HostDiskClient>(service);
}

bool AttachHostDisk(sim::Service& service, std::string* why) {
  const cf::String* device = service.properties.Get("device").AsString();
  if (!device) {
    *why = "a host disk needs \"device\" (a path under /dev) among its properties; left out";
    return false;
  }
  std::string reason;
  if (!ReadHostDisk(*device, &reason)) {
    *why = "the disk " + *device + " cannot be read (" + reason + "); no controller there";
    return false;
  }
  service.properties.Set("Controller Characteristics", HostDiskCharacteristics(*device, IdentifyHostDisk(*device)));
  return true;
}

}  // namespace

void RegisterHostDiskKind() {
  static std::once_flag once;
  std::call_once(once, [] { sim::RegisterUserClientKind("host", &CreateHostDiskClient, &AttachHostDisk); });
}

std::optional<HostDiskReading> ReadHostDisk(const std::string& device, std::string* why) {
  const std::string name = DeviceName(device);
  if (name.empty()) {
    *why = "\"" + device + "\" is not a device under /dev";
    return std::nullopt;
  }
  const std::vector<std::string> blocks = BlockDevicesOf(name);
  if (blocks.empty()) {
    *why = "the NVMe controller " + name + " has no namespaces in " + Sysfs() + "/class/nvme/" + name;
    return std::nullopt;
  }
  HostDiskReading reading;
  for (size_t i = 0; i < blocks.size(); ++i) {
    const std::string path = Sysfs() + "/block/" + blocks[i] + "/stat";
    std::string error;
    const auto text = ReadFile(path, &error);
    if (!text) {
      *why = error;
      return std::nullopt;
    }
    const auto stat = ParseBlockStat(*text);
    if (!stat) {
      *why = path + " is not a block statistics line";
      return std::nullopt;
    }
    if (i == 0) reading.stat = *stat;
    else AddBlockStat(reading.stat, *stat);
  }
  reading.health = NvmeController(name).Health();
  return reading;
}

std::optional<std::string> HostDiskStatisticsBuffer(const std::string& device, std::string* why) {
  const auto reading = ReadHostDisk(device, why);
  if (!reading) return std::nullopt;
  return sim::EncodeFtlFields(HostDiskFtlFields(reading->stat, reading->health ? &*reading->health : nullptr), why);
}

DiskIdentity IdentifyHostDisk(const std::string& device) {
  const std::string name = DeviceName(device);
  if (name.empty()) return {};
  DiskIdentity id = NvmeController(name).Identity().value_or(DiskIdentity{});
  const std::string sys = Sysfs();
  // What the controller did not say, sysfs may.
  const std::string dev = IsNvmeController(name) ? sys + "/class/nvme/" + name : sys + "/block/" + name + "/device";
  if (id.model.empty()) id.model = FirstText({dev + "/model"});
  if (id.serial.empty()) id.serial = FirstText({dev + "/serial", sys + "/block/" + name + "/serial"});
  if (id.firmware.empty()) id.firmware = FirstText({dev + "/firmware_rev", dev + "/rev"});
  if (id.vendor.empty()) id.vendor = FirstText({dev + "/vendor"});
  if (!id.capacity_bytes) {
    uint64_t sectors = 0;
    bool known = false;
    for (const std::string& block : BlockDevicesOf(name)) {
      const std::string text = SysfsText(sys + "/block/" + block + "/size");
      char* end = nullptr;
      const unsigned long long n = std::strtoull(text.c_str(), &end, 10);
      if (text.empty() || *end != '\0' || n > (UINT64_MAX >> 9) - sectors) continue;
      sectors += n;
      known = true;
    }
    if (known && sectors > 0) id.capacity_bytes = sectors * 512;  // sysfs sizes are in 512-byte sectors
  }
  return id;
}

std::vector<std::string> ListHostDisks(const std::string& path) {
  std::string holding_dev;
  struct stat st;
  if (stat(path.c_str(), &st) == 0)
    holding_dev = std::to_string(major(st.st_dev)) + ":" + std::to_string(minor(st.st_dev));
  const std::string block = Sysfs() + "/block/";
  std::vector<std::string> disks;
  std::string holding;
  for (const std::string& name : SortedEntries(block)) {
    if (name.rfind("loop", 0) == 0 || name.rfind("ram", 0) == 0 || name.rfind("zram", 0) == 0) continue;
    disks.push_back("/dev/" + name);
    if (!holding.empty() || holding_dev.empty()) continue;
    // The disk itself, or one of its partitions (subdirectories with a dev).
    bool holds = SysfsText(block + name + "/dev") == holding_dev;
    for (const std::string& part : SortedEntries(block + name))
      if (!holds && part.rfind(name, 0) == 0 && part != name) holds = SysfsText(block + name + "/" + part + "/dev") == holding_dev;
    if (holds) holding = "/dev/" + name;
  }
  if (!holding.empty()) {
    disks.erase(std::find(disks.begin(), disks.end(), holding));
    disks.insert(disks.begin(), holding);
  }
  return disks;
}

namespace testing {
void SetSysfsBase(const std::string& base) {
  std::lock_guard<std::mutex> lock(g_sysfs_mu);
  g_sysfs_base = base;
}
}  // namespace testing

}  // namespace platform
