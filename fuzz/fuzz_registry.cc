// Device files as a person (or a broken tool) writes them: a registry.plist
// loaded into services, matched and searched, and the same bytes as the
// controller.plist its user clients answer from.
#include <cstring>
#include <string_view>

#include "cf/plist.h"
#include "sim/device.h"

namespace {

class Files : public sim::DeviceFiles {
 public:
  explicit Files(cf::Value v) : value_(std::move(v)) {}
  cf::Value Read(std::string_view) override { return value_; }
  void Complain(const std::string&) override {}

 private:
  cf::Value value_;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const cf::ParseResult parsed = cf::ParsePropertyList(std::string_view(reinterpret_cast<const char*>(data), size));
  if (!parsed.ok()) return 0;
  std::string error;
  const sim::Registry registry = sim::Registry::Load(parsed.value, &error);
  Files files(parsed.value);
  for (const sim::Service& s : registry.services()) {
    cf::Dictionary by_class;
    by_class.Set("IOProviderClass", s.class_name);
    (void)registry.Match(by_class);
    cf::Dictionary by_property;
    by_property.Set("IOPropertyMatch", s.properties);
    (void)registry.Match(by_property);
    (void)registry.Property(s.id, "Controller Characteristics", true);  // parents may loop
    auto client = sim::CreateUserClient(s, files);
    if (!client) continue;
    for (uint32_t command : {13u, 221u, 15u, 17u, 11u}) {
      for (uint32_t phase : {1u, 0u}) {
        uint8_t record[24] = {};
        std::memcpy(record, &command, 4);
        std::memcpy(record + 4, &phase, 4);
        uint8_t out[256];
        size_t out_size = sizeof out;
        sim::MethodCall call;
        call.selector = s.class_name == "VSPStorage" ? 8 : 9;
        call.struct_in = record;
        call.struct_in_size = sizeof record;
        call.struct_out = out;
        call.struct_out_size = &out_size;
        (void)client->CallMethod(call);
      }
    }
  }
  // The whole input as matching dictionaries too.
  (void)registry.Match(parsed.value);
  return 0;
}
