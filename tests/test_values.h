// Building property-list values in tests.
#pragma once

#include <initializer_list>
#include <string>
#include <utility>

#include "cf/value.h"

inline cf::Dictionary Dict(std::initializer_list<std::pair<const char*, cf::Value>> entries) {
  return cf::Dictionary::Of(entries);
}

inline cf::Value Raw(const std::string& bytes) { return cf::Value::Bytes(cf::Data(bytes.begin(), bytes.end())); }
