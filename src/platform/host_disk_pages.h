// What a real disk reports, decoded from its bytes alone so that every
// decoder can be tested and fuzzed without a disk: the block layer's
// statistics line, the NVMe health information log page and the
// identify-controller data, and how those numbers become the FTL fields of a
// statistics buffer.
//
// Units. The FTL counts host traffic (hostReads, hostWrites, numUnmapSec) in
// 4096-byte sectors: the write amplification divides band erases times the
// band's size in 4 KiB units by hostWrites. The block layer counts 512-byte
// sectors (whatever the disk's own sector size), so its counts are divided
// by 8, rounding down; NVMe counts data units of 1000 x 512 bytes, which are
// exactly 125 sectors of 4 KiB.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "cf/value.h"

namespace platform {

inline constexpr uint64_t kFtlSectorBytes = 4096;

// /sys/block/<dev>/stat: at least 11 decimal counters separated by blanks;
// discards (fields 12 to 15) came with later kernels, flushes (16 and 17)
// later still. Counters since boot.
struct BlockStat {
  uint64_t reads = 0;  // requests completed
  uint64_t sectors_read = 0;
  uint64_t writes = 0;
  uint64_t sectors_written = 0;
  std::optional<uint64_t> discards;
  std::optional<uint64_t> sectors_discarded;
  std::optional<uint64_t> flushes;
};
// Nothing for anything but such a line: fewer than 11 fields, a field that
// is not a plain decimal number or does not fit 64 bits.
std::optional<BlockStat> ParseBlockStat(std::string_view text);
// Adds more to into (the namespaces of one NVMe controller), saturating; an
// optional counter stays only when both have it.
void AddBlockStat(BlockStat& into, const BlockStat& more);

// The SMART / health information log page (log identifier 02h): 512 bytes.
inline constexpr size_t kNvmeHealthPageBytes = 512;
struct NvmeHealth {
  uint8_t critical_warning = 0;
  uint16_t temperature_kelvin = 0;  // composite temperature; 0: not reported
  uint8_t available_spare = 0;      // percent
  uint8_t percent_used = 0;         // an estimate; may pass 100
  // The 128-bit counters, saturated at 2^64 - 1.
  uint64_t data_units_read = 0;  // thousands of 512-byte units
  uint64_t data_units_written = 0;
  uint64_t host_read_commands = 0;
  uint64_t host_write_commands = 0;
  uint64_t power_cycles = 0;
  uint64_t power_on_hours = 0;
  uint64_t unsafe_shutdowns = 0;
  uint64_t media_errors = 0;
};
// Nothing for a page shorter than 512 bytes; bytes past 512 are ignored.
std::optional<NvmeHealth> DecodeNvmeHealthPage(std::string_view page);
// A little-endian 128-bit counter, saturated at 2^64 - 1.
uint64_t SaturatedCounter128(const unsigned char* sixteen_bytes);

// What a disk says it is; empty text and no capacity where it says nothing.
struct DiskIdentity {
  std::string model;
  std::string serial;
  std::string firmware;
  std::string vendor;
  std::optional<uint64_t> capacity_bytes;
};
// The identify-controller data structure: 4096 bytes. Text fields are
// space-padded ASCII (trimmed here; other bytes become '?'); the capacity is
// the total NVM capacity, absent when the controller reports 0 or more than
// 64 bits.
inline constexpr size_t kNvmeIdentifyBytes = 4096;
std::optional<DiskIdentity> DecodeNvmeIdentifyController(std::string_view data);

// The FTL fields (name -> number, in the form sim::EncodeFtlFields takes)
// of a disk: its block statistics, and, when the health page could be read,
// the NVMe lifetime counts over them. See the README's host disk table.
cf::Dictionary HostDiskFtlFields(const BlockStat& stat, const NvmeHealth* health);

// The "Controller Characteristics" property of a disk's service.
cf::Dictionary HostDiskCharacteristics(const std::string& device, const DiskIdentity& identity);

// Leading and trailing blanks and newlines removed, as sysfs text needs.
std::string TrimmedText(std::string_view text);

}  // namespace platform
