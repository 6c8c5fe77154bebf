// The FTL statistics field table.
#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <string_view>

namespace parsers {

struct FtlField {
  uint32_t key;
  const char* name;
  uint32_t count;  // elements of an array field; 0 for a scalar
  uint32_t length = static_cast<uint32_t>(std::char_traits<char>::length(name));  // of the name
  bool is_array() const { return count > 0; }
  std::string_view name_view() const { return {name, length}; }
};

// The row of a record key, or null for a key that carries no field.
const FtlField* FindFtlField(uint32_t key);
// Every row, in key order.
std::span<const FtlField> FtlFields();

}  // namespace parsers
