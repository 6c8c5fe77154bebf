// keyMap: the named controller statistics that the NAND info dictionary
// carries, each with the store key it is written under.
#pragma once

#include <cstddef>
#include <string_view>

struct KeyMapRecord {
  std::string_view name;  // the field name as the parsers produce it
  std::string_view key;   // "com.velmora.NANDInfo." + suffix
};

inline constexpr size_t kKeyMapSize = 709;

// In table order. No name appears twice (checked at compile time).
extern const KeyMapRecord keyMap[kKeyMapSize];

// The record for a field name, or null. A binary search over a sorted index
// built at compile time: this runs once per statistic, thousands a day.
//
// Names are significant to 100 characters. Every table name is far shorter,
// so comparing whole names gives the same answer for any input, including
// a context name of up to 98 characters.
const KeyMapRecord* FindKeyMapRecord(std::string_view name);
