// Legend channels for the reporting-channel tests: [ID, type, name].
#pragma once

#include "cf/value.h"
#include "ioreport/ioreport.h"

inline int64_t Type(uint8_t format, uint16_t categories, uint16_t elements) {
  return IOReportChannelType(format, categories, elements);
}

inline cf::Value Legend(int64_t id, int64_t type, const char* name = nullptr) {
  cf::Array a({cf::Value::SInt64(id), cf::Value::SInt64(type)});
  if (name) a.Append(name);
  return a;
}
