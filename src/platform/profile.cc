#include "platform/profile.h"

#include "cf/plist.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"

namespace platform {

cf::Value ReadProfileValue(const std::string& device_path) {
  const std::string path = Context::Current().Path(device_path);
  const auto bytes = ReadFile(path);
  if (!bytes) return {};
  cf::ParseResult parsed = cf::ParsePropertyList(*bytes);
  if (!parsed.ok()) {
    LogError("%s is not a property list (%s); ignoring it", path, parsed.error);
    return {};
  }
  return parsed.value;
}

cf::Dictionary ReadProfileDictionary(const std::string& device_path) {
  const cf::Value v = ReadProfileValue(device_path);
  if (const cf::Dictionary* d = v.AsDictionary()) return *d;
  if (!v.IsNull())
    LogError("%s is %s, not a dictionary; ignoring it", Context::Current().Path(device_path),
             cf::TypeNameWithArticle(v.type()));
  return {};
}

std::map<std::string, std::string> ReadOsRelease() {
  std::map<std::string, std::string> out;
  const auto text = ReadFile("/etc/os-release");
  if (!text) return out;
  size_t start = 0;
  while (start < text->size()) {
    size_t end = text->find('\n', start);
    if (end == std::string::npos) end = text->size();
    const std::string line = text->substr(start, end - start);
    start = end + 1;
    const size_t eq = line.find('=');
    if (eq == std::string::npos || line[0] == '#') continue;
    std::string value = line.substr(eq + 1);
    if (value.size() >= 2 && (value.front() == '"' || value.front() == '\'') && value.back() == value.front())
      value = value.substr(1, value.size() - 2);
    out[line.substr(0, eq)] = value;
  }
  return out;
}

}  // namespace platform
