// The FTL statistics field table.
#pragma once

#include <cstdint>
#include <span>

namespace parsers {

struct FtlField {
  uint32_t key;
  const char* name;
  uint32_t count;  // elements of an array field; 0 for a scalar
  bool is_array() const { return count > 0; }
};

// The row of a record key, or null for a key that carries no field.
const FtlField* FindFtlField(uint32_t key);
// Every row, in key order.
std::span<const FtlField> FtlFields();

}  // namespace parsers
