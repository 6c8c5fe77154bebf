// Encoders of kcdata stackshot buffers: the simulated device's stackshot
// is made from a description a person can write by hand, and tests and fuzz
// seeds build hostile buffers item by item.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "cf/value.h"

namespace sim {

// Task names go in an item of this type inside the task's container; the
// search never looks at it, so a task named like the thread cannot match.
inline constexpr uint32_t kKCDataTaskNameType = 0x905;
// What the begin item's 4-byte payload says a container holds. Readers
// only need the payload to be there.
inline constexpr uint32_t kKCDataStackshotKind = 1;
inline constexpr uint32_t kKCDataTaskKind = 2;
inline constexpr uint32_t kKCDataThreadKind = 3;
// Names are NUL-padded to this many bytes, so at most 63 characters.
inline constexpr size_t kKCDataNameBytes = 64;

// Items one by one, well-formed or not.
class KCDataBuilder {
 public:
  // A header whose size is the payload's length, then the payload.
  KCDataBuilder& Item(uint32_t type, std::string_view payload, uint64_t flags = 0);
  // A header claiming any size, with nothing after it.
  KCDataBuilder& Header(uint32_t type, uint32_t size, uint64_t flags = 0);
  KCDataBuilder& Bytes(std::string_view raw);
  // Container begin (4-byte payload holding kind) and end, paired by id.
  KCDataBuilder& Begin(uint64_t id, uint32_t kind = kKCDataThreadKind);
  KCDataBuilder& End(uint64_t id);
  // name NUL-padded to `padded` bytes (no padding when padded <= its length).
  KCDataBuilder& ThreadName(std::string_view name, size_t padded = kKCDataNameBytes);
  KCDataBuilder& TaskName(std::string_view name);
  // I/O statistics of four u64 fields with disk writes the fourth.
  KCDataBuilder& IOStats(uint64_t diskWrites);
  // I/O statistics of exactly these fields.
  KCDataBuilder& IOStatsFields(const std::vector<uint64_t>& fields);
  KCDataBuilder& BufferEnd();
  const std::string& bytes() const { return bytes_; }
  size_t size() const { return bytes_.size(); }

 private:
  std::string bytes_;
};

// A stackshot from an array of tasks, each a dictionary
//   {"name": string, "threads": [{"name": string, "diskWrites": integer >= 0}]}
// ("threads" may be absent; a thread without "diskWrites" has no
// I/O-statistics item). All tasks sit in one stackshot container, each
// thread's container in its task's, then an end-of-buffer item. Null with
// the reason in *error for a description of another shape.
std::optional<std::string> EncodeKCDataStackshot(const cf::Value& tasks, std::string* error);

}  // namespace sim
