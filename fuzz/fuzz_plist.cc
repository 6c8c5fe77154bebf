// Property lists and service messages from outside the process, and the
// run record read back from the root.
#include <string_view>

#include "cf/plist.h"
#include "platform/run_record.h"
#include "platform/service.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  const cf::ParseResult parsed = cf::ParsePropertyList(bytes);
  if (parsed.ok()) {
    std::string xml, error;
    if (cf::WriteXMLPropertyList(parsed.value, xml, &error)) {
      const cf::ParseResult again = cf::ParsePropertyList(xml);
      (void)again;
    }
    (void)parsed.value.Description();
    if (const auto record = platform::RunRecord::FromValue(parsed.value)) (void)record->ToValue();
  }
  std::string error;
  (void)platform::DecodeServiceMessage(bytes, &error);
  (void)cf::ParseJSON(bytes);
  return 0;
}
