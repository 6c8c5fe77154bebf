// The image driver's answers from ean.plist: the images the system asks for
// and every image the file names, by both queries, through the driver's
// user client. A file that is there but wrong must be explained by a
// complaint whenever a query fails because of it; nothing else complains,
// and an answer is always one scalar.
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "cf/plist.h"
#include "sim/device.h"
#include "sim/user_clients.h"

namespace {

class EanFile : public sim::DeviceFiles {
 public:
  explicit EanFile(cf::Value v) : value_(std::move(v)) {}
  cf::Value Read(std::string_view name) override { return name == "ean.plist" ? value_ : cf::Value(); }
  void Complain(const std::string& text) override {
    if (text.empty()) __builtin_trap();
    ++complaints;
  }
  int complaints = 0;

 private:
  cf::Value value_;
};

constexpr uint32_t kImageSize = 3, kUpdateCount = 7;
constexpr uint64_t kUntouched = 0x5A5A5A5A5A5A5A5Aull;

// A code's four characters packed most significant first, as the system
// passes them; shorter text is padded with NULs.
uint64_t Key(std::string_view code) {
  uint64_t key = 0;
  for (size_t i = 0; i < 4; ++i) key = key << 8 | (i < code.size() ? static_cast<uint8_t>(code[i]) : 0);
  return key;
}

void Ask(sim::UserClient& client, EanFile& file, uint32_t selector, uint64_t key) {
  uint64_t out = kUntouched;
  uint32_t out_count = 1;
  sim::MethodCall call;
  call.selector = selector;
  call.scalar_in = &key;
  call.scalar_in_count = 1;
  call.scalar_out = &out;
  call.scalar_out_count = &out_count;
  file.complaints = 0;
  const sim::kern_return_t rc = client.CallMethod(call);
  if (rc != sim::kIOReturnSuccess && rc != sim::kIOReturnNotFound && rc != sim::kIOReturnError) __builtin_trap();
  if ((rc == sim::kIOReturnError) != (file.complaints == 1) || file.complaints > 1) __builtin_trap();
  if (rc == sim::kIOReturnSuccess && out_count != 1) __builtin_trap();
  if (rc != sim::kIOReturnSuccess && out != kUntouched) __builtin_trap();
  // No image has a code wider than four characters.
  if (key > 0xFFFFFFFFu && rc != sim::kIOReturnNotFound) __builtin_trap();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const cf::ParseResult parsed = cf::ParsePropertyList(std::string_view(reinterpret_cast<const char*>(data), size));
  if (!parsed.ok()) return 0;
  EanFile file(parsed.value);
  sim::Service service;
  service.class_name = "VelmoraNVMeEAN";
  service.id = 3;
  service.user_client = "ean";
  const std::unique_ptr<sim::UserClient> client = sim::CreateEanClient(service, file);

  std::vector<uint64_t> keys;
  for (const char* code : {"dBIC", "dLTH", "ifw1", "dCfg", "fCfg", "nefw", "LPEM"}) keys.push_back(Key(code));
  keys.push_back(0);
  keys.push_back(uint64_t{1} << 32 | Key("dBIC"));
  if (const cf::Dictionary* images = parsed.value.AsDictionary()) {
    size_t named = 0;
    for (const auto& [code, image] : *images) {
      if (++named > 32) break;
      if (code.AsString()) keys.push_back(Key(code.StringView()));
    }
  }
  for (uint64_t key : keys)
    for (uint32_t selector : {kImageSize, kUpdateCount}) Ask(*client, file, selector, key);

  // Malformed calls are refused before the file is read.
  uint64_t key = Key("dBIC"), pair[2] = {key, key}, out = 0;
  uint32_t out_count = 1;
  for (int shape = 0; shape < 3; ++shape) {
    sim::MethodCall call;
    call.selector = kImageSize;
    call.scalar_in = shape == 0 ? pair : &key;
    call.scalar_in_count = shape == 0 ? 2 : 1;
    call.scalar_out = &out;
    out_count = shape == 1 ? 2 : 1;
    call.scalar_out_count = &out_count;
    const uint8_t extra = 0;
    if (shape == 2) {
      call.struct_in = &extra;
      call.struct_in_size = 1;
    }
    file.complaints = 0;
    if (client->CallMethod(call) != sim::kIOReturnBadArgument || file.complaints != 0) __builtin_trap();
  }
  return 0;
}
