// The MSP statistics field table.
#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <string_view>

namespace parsers {

struct MspField {
  uint32_t key;
  const char* name;
  uint32_t count;  // 32-bit elements; 1 for a single value
  uint32_t length = static_cast<uint32_t>(std::char_traits<char>::length(name));  // of the name
  std::string_view name_view() const { return {name, length}; }
};

// The row of a record key, or null for a key that carries no field.
const MspField* FindMspField(uint32_t key);
// Every row, in key order.
std::span<const MspField> MspFields();

}  // namespace parsers
