// Building property-list values in tests.
#pragma once

#include <initializer_list>
#include <string>
#include <utility>

#include "cf/value.h"

inline cf::Dictionary Dict(std::initializer_list<std::pair<const char*, cf::Value>> entries) {
  cf::Dictionary d;
  for (const auto& [k, v] : entries) d.Set(k, v);
  return d;
}

inline cf::Value Raw(const std::string& bytes) { return cf::Value::Bytes(cf::Data(bytes.begin(), bytes.end())); }
