// This machine's own disks as storage controllers: the user-client kind
// "host". A registry service {"userClient": "host", "properties": {"device":
// "/dev/NAME"}} (a block device such as /dev/vda or /dev/nvme0n1, or an NVMe
// controller such as /dev/nvme0) answers the statistics command (13) with an
// FTL buffer built from the disk's block statistics and, where the NVMe
// controller can be opened, its health log page. Every other command is
// unsupported.
//
// A disk is readable when /sys/block/<NAME>/stat can be read (for an NVMe
// controller, those of its namespaces). An unreadable one is left out of the
// registry when it loads, with one log line, as an absent controller.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/host_disk_pages.h"

namespace platform {

// Registers the "host" kind with the device registry; once per process.
void RegisterHostDiskKind();

// What a disk reports right now.
struct HostDiskReading {
  BlockStat stat;
  std::optional<NvmeHealth> health;  // when its NVMe controller could be asked
};
// device is "/dev/NAME". Nothing, with the reason in *why, when it names no
// readable disk.
std::optional<HostDiskReading> ReadHostDisk(const std::string& device, std::string* why);
// The statistics command's buffer: the FTL word records of the reading.
std::optional<std::string> HostDiskStatisticsBuffer(const std::string& device, std::string* why);
// Model, serial, firmware and capacity: from the NVMe controller when it can
// be asked, else from sysfs.
DiskIdentity IdentifyHostDisk(const std::string& device);

// The machine's disks ("/dev/NAME") in /sys/block order, without loop, ram
// and zram devices; the disk holding path (itself or through a partition)
// first when it is one of them.
std::vector<std::string> ListHostDisks(const std::string& path);

namespace testing {
// Reads the sysfs tree under base instead of /sys; "" restores /sys. For
// tests only: the product always reads the machine's own /sys.
void SetSysfsBase(const std::string& base);
}  // namespace testing

}  // namespace platform
