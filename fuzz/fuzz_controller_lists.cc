// The storage controller's answers as controller.plist describes them: the
// parsed file behind the controller's user client, of both controller kinds,
// asked every tunnel command in the size phase and then the data phase; and
// the lists a field dictionary describes, encoded and read back by the
// readers the daily job uses.
#include <algorithm>
#include <cstdint>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>

#include "cf/bytes.h"
#include "cf/plist.h"
#include "sim/device.h"
#include "sim/storage_lists.h"
#include "sim/user_clients.h"
#include "storagelog/storagelog.h"

namespace {

class ControllerFile : public sim::DeviceFiles {
 public:
  explicit ControllerFile(cf::Value v) : value_(std::move(v)) {}
  cf::Value Read(std::string_view name) override { return name == "controller.plist" ? value_ : cf::Value(); }
  // A complaint that says nothing helps nobody.
  void Complain(const std::string& text) override {
    if (text.empty()) __builtin_trap();
  }

 private:
  cf::Value value_;
};

// Every family the controller answers, and codes it does not know.
constexpr uint32_t kCommands[] = {13, 221, 15, 17, 39, 22, 145, 11, 0, 16, 0xFFFFFFFF};
// The largest data-phase buffer offered; a longer answer comes back cut.
constexpr size_t kMaxOffered = size_t{1} << 20;

// Heap buffers of exactly the size offered, so that a write past the
// capacity is caught.
std::unique_ptr<uint8_t[]> Buffer(size_t size) { return std::make_unique<uint8_t[]>(size ? size : 1); }

sim::kern_return_t Tunnel(sim::UserClient& client, uint32_t method, uint32_t command, uint32_t flags, uint32_t index,
                          void* out, size_t* out_size) {
  uint8_t record[24] = {};
  std::memcpy(record, &command, 4);
  std::memcpy(record + 4, &flags, 4);
  std::memcpy(record + 8, &index, 4);
  sim::MethodCall call;
  call.selector = method;
  call.struct_in = record;
  call.struct_in_size = sizeof record;
  call.struct_out = out;
  call.struct_out_size = out_size;
  return client.CallMethod(call);
}

// One command in both phases, as the list readers ask it.
void AskCommand(sim::UserClient& client, uint32_t method, uint32_t command, uint32_t mode, uint32_t index,
                bool phases_may_differ, bool answers_may_be_short) {
  const uint32_t mode_bits = (mode & 0xFF) << 2;
  auto size_out = Buffer(4);
  size_t size_bytes = 4;
  const sim::kern_return_t size_rc = Tunnel(client, method, command, mode_bits | 1, index, size_out.get(), &size_bytes);
  uint32_t announced = 0;
  if (size_rc == sim::kIOReturnSuccess) {
    if (size_bytes != 4) __builtin_trap();
    std::memcpy(&announced, size_out.get(), 4);
  }

  const size_t offered = size_rc == sim::kIOReturnSuccess ? std::min<size_t>(announced, kMaxOffered) : 64;
  auto data = Buffer(offered);
  size_t data_bytes = offered;
  const sim::kern_return_t data_rc = Tunnel(client, method, command, mode_bits, index, data.get(), &data_bytes);
  // Both phases read the same file: unless it fails one of them on
  // purpose, they answer alike, and the data is what the size announced.
  if (!phases_may_differ && (size_rc == sim::kIOReturnSuccess) != (data_rc == sim::kIOReturnSuccess))
    __builtin_trap();
  if (data_rc == sim::kIOReturnSuccess) {
    if (data_bytes > offered) __builtin_trap();
    if (size_rc == sim::kIOReturnSuccess && !answers_may_be_short && data_bytes != offered) __builtin_trap();
  }

  // A buffer smaller than the answer gets the answer's start, no more.
  auto small = Buffer(3);
  size_t small_bytes = 3;
  if (Tunnel(client, method, command, mode_bits, index, small.get(), &small_bytes) == sim::kIOReturnSuccess &&
      small_bytes > 3)
    __builtin_trap();
}

void AskController(const sim::Service& service, ControllerFile& file, const cf::Dictionary* controller) {
  std::unique_ptr<sim::UserClient> client = sim::CreateNvmeClient(service, file);
  const bool storage_kind = service.class_name == "VSPStorage";
  const uint32_t method = storage_kind ? 8 : 9;
  const bool phases_may_differ = controller && (controller->Contains("failCommands") ||
                                                controller->Contains("failDataCommands"));
  const bool answers_may_be_short = controller && controller->Contains("shortData");
  for (uint32_t command : kCommands) {
    if (command == 221) {
      for (uint32_t index : {0u, 1u, 2u, 0xFFFFFFFFu})
        AskCommand(*client, method, command, 0, index, phases_may_differ, answers_may_be_short);
    } else if (command == 17) {
      for (uint32_t mode : {0u, 1u, 2u, 3u, 255u})
        AskCommand(*client, method, command, mode, 0, phases_may_differ, answers_may_be_short);
    } else {
      AskCommand(*client, method, command, 0, 0, phases_may_differ, answers_may_be_short);
    }
  }
  if (storage_kind) {
    for (size_t capacity : {size_t{0}, size_t{4}, size_t{64}}) {
      auto out = Buffer(capacity);
      size_t out_bytes = capacity;
      sim::MethodCall call;
      call.selector = 5;
      call.struct_out = out.get();
      call.struct_out_size = &out_bytes;
      if (client->CallMethod(call) == sim::kIOReturnSuccess && out_bytes > capacity) __builtin_trap();
    }
  }
  // A record of the wrong length is refused before anything is read.
  uint8_t short_record[23] = {};
  size_t out_bytes = 0;
  sim::MethodCall call;
  call.selector = method;
  call.struct_in = short_record;
  call.struct_in_size = sizeof short_record;
  call.struct_out_size = &out_bytes;
  if (client->CallMethod(call) != sim::kIOReturnBadArgument) __builtin_trap();
}

const uint8_t* Bytes(const std::string& s) { return reinterpret_cast<const uint8_t*>(s.data()); }

// The validity list: every entry of lists 0 to 15 the file describes is
// read back.
void ValidityRoundTrip(const cf::Dictionary& fields) {
  std::string error;
  const auto encoded = sim::EncodeValidityList(fields, &error);
  if (!encoded) {
    if (error.empty()) __builtin_trap();
    return;
  }
  const cf::Array* entries = fields.Get("entries").AsArray();
  const size_t count = entries ? entries->size() : 0;
  const uint32_t extra = cf::LoadLE32(encoded->data() + 4);
  if (cf::LoadLE32(encoded->data()) != count || encoded->size() != 8 + 8 * uint64_t{extra} + 20 * uint64_t{count})
    __builtin_trap();
  size_t listed = 0;
  for (size_t i = 0; i < count; ++i) {
    const cf::Number* list = (*entries)[i].AsDictionary()->Get("list").AsNumber();
    if (!list || (list->AsSInt64() >= 0 && list->AsSInt64() < 16)) ++listed;
  }
  const auto lists = ValidityValues(Bytes(*encoded), encoded->size());
  if (lists.has_value() != (count > 0)) __builtin_trap();
  size_t read = 0;
  if (lists)
    for (const cf::Array& list : *lists) read += list.size();
  if (read != listed) __builtin_trap();
}

// The defects list: its header and one record per defect described.
void DefectsRoundTrip(const cf::Dictionary& fields) {
  std::string error;
  const auto encoded = sim::EncodeDefectsList(fields, &error);
  if (!encoded) {
    if (error.empty()) __builtin_trap();
    return;
  }
  const cf::Array* defects = fields.Get("defects").AsArray();
  const size_t count = defects ? defects->size() : 0;
  size_t records = 0;
  const bool read = ForEachDefectRecord(Bytes(*encoded), encoded->size(), cf::Value(), "VSPStorage",
                                        [&](const cf::Dictionary&) { ++records; });
  if (!read || records != 1 + count) __builtin_trap();
}

// The telemetry list: a block and a summary per bus described.
void TelemetryRoundTrip(const cf::Dictionary& fields) {
  std::string error;
  const auto encoded = sim::EncodeTelemetryList(fields, &error);
  if (!encoded) {
    if (error.empty()) __builtin_trap();
    return;
  }
  const cf::Array* buses = fields.Get("buses").AsArray();
  if (encoded->size() != (buses ? buses->size() : 0) * (4096 + 32)) __builtin_trap();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const cf::ParseResult parsed = cf::ParsePropertyList(std::string_view(reinterpret_cast<const char*>(data), size));
  if (!parsed.ok()) return 0;
  ControllerFile file(parsed.value);
  const cf::Dictionary* controller = parsed.value.AsDictionary();
  for (const char* class_name : {"VelmoraVNS3NVMeController", "VSPStorage"}) {
    sim::Service service;
    service.class_name = class_name;
    service.id = 2;
    service.user_client = "nvme";
    AskController(service, file, controller);
  }
  if (!controller) return 0;
  if (const cf::Dictionary* fields = controller->Get("bandStats").AsDictionary()) ValidityRoundTrip(*fields);
  if (const cf::Dictionary* fields = controller->Get("defects").AsDictionary()) DefectsRoundTrip(*fields);
  if (const cf::Dictionary* modes = controller->Get("telemetry").AsDictionary()) {
    for (const auto& [mode, fields] : *modes)
      if (const cf::Dictionary* list = fields.AsDictionary()) TelemetryRoundTrip(*list);
  }
  return 0;
}
