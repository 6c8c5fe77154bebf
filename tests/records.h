// Reading back what a run wrote: structured-data records and submitted logs.
#pragma once

#include <filesystem>
#include <string>
#include <vector>

#include "cf/plist.h"
#include "platform/files.h"

// The objects of a file of JSON lines, in order (other lines skipped).
inline std::vector<cf::Dictionary> JSONLines(const std::string& path) {
  std::vector<cf::Dictionary> out;
  const std::string text = platform::ReadFile(path).value_or("");
  for (size_t start = 0; start < text.size();) {
    const size_t end = text.find('\n', start);
    const cf::Value line = cf::ParseJSON(text.substr(start, end - start)).value;
    start = end == std::string::npos ? text.size() : end + 1;
    if (const cf::Dictionary* d = line.AsDictionary()) out.push_back(*d);
  }
  return out;
}

// The records of one type in a structured-data log (JSON lines), in order.
inline std::vector<cf::Dictionary> StructuredRecords(const std::string& path, int type) {
  std::vector<cf::Dictionary> out;
  for (const cf::Dictionary& d : JSONLines(path))
    if (d.Get("type") == cf::Value::SInt32(type) && d.Get("record").AsDictionary())
      out.push_back(*d.Get("record").AsDictionary());
  return out;
}

// The contents of the files in dir whose names end in extension (".165").
inline std::vector<std::string> FilesEndingIn(const std::string& dir, const std::string& extension) {
  std::vector<std::string> out;
  std::error_code ec;
  for (const auto& e : std::filesystem::directory_iterator(dir, ec))
    if (e.path().extension() == extension) out.push_back(platform::ReadFile(e.path().string()).value_or(""));
  return out;
}
