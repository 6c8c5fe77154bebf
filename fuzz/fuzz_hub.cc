// The reporting hub's answers: a registry.plist whose drivers publish
// legends and an ioreport.plist of channel values, behind the hub's user
// client. The input is one byte of flags, a 16-bit big-endian length, the
// registry as a property list of that length, then the values as another.
// Flag bit 0 also asks for a channel no legend names, bit 1 asks for every
// channel twice.
//
// The hub is asked for the channels of every legend the way a subscriber
// asks (open, interests, map, update), and its buffer is read back into
// samples. Whatever the files say, the buffer is whole records of 64-byte
// elements, each record of a channel that was asked for, its elements
// numbered from 0 in order.
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <memory>
#include <set>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "cf/bytes.h"
#include "cf/plist.h"
#include "ioreport/ioreport.h"
#include "ioreport/samples.h"
#include "ioreport_ask.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/log.h"
#include "scratch_root.h"
#include "sim/device.h"
#include "sim/user_clients.h"

namespace {

class HubFiles : public sim::DeviceFiles {
 public:
  HubFiles(cf::Value registry, cf::Value values) : registry_(std::move(registry)), values_(std::move(values)) {}
  cf::Value Read(std::string_view name) override {
    if (name == "registry.plist") return registry_;
    if (name == "ioreport.plist") return values_;
    return cf::Value();
  }
  void Complain(const std::string&) override {}

 private:
  cf::Value registry_, values_;
};

constexpr uint32_t kOpen = 0, kConfigureInterests = 2, kUpdate = 3;
constexpr size_t kElement = 64;
constexpr size_t kMaxBuffer = size_t{64} << 20;


cf::Value Parse(std::string_view bytes) {
  cf::ParseResult parsed = cf::ParsePropertyList(bytes);
  return parsed.ok() ? parsed.value : cf::Value();
}

sim::kern_return_t Call(sim::UserClient& client, uint32_t selector, const uint64_t* scalars, uint32_t scalar_count,
                        const std::vector<uint8_t>* in, uint64_t* out, uint32_t* out_count) {
  sim::MethodCall call;
  call.selector = selector;
  call.scalar_in = scalars;
  call.scalar_in_count = scalar_count;
  if (in) {
    call.struct_in = in->data();
    call.struct_in_size = in->size();
  }
  uint32_t no_scalars = 0;
  size_t no_bytes = 0;
  call.scalar_out = out;
  call.scalar_out_count = out_count ? out_count : &no_scalars;
  call.struct_out_size = &no_bytes;
  return client.CallMethod(call);
}

// The buffer's shape: whole records, each of a channel asked for, elements
// numbered 0, 1, ... up to the count the element's type gives.
void CheckBuffer(std::string_view buffer, const std::set<std::pair<uint64_t, uint64_t>>& asked) {
  if (buffer.size() % kElement != 0 || buffer.size() > kMaxBuffer) __builtin_trap();
  uint64_t driver = 0, channel = 0, next = 0, count = 0;
  for (size_t at = 0; at < buffer.size(); at += kElement) {
    const char* e = buffer.data() + at;
    const uint64_t d = cf::LoadLE64(e), c = cf::LoadLE64(e + 8), type = cf::LoadLE64(e + 16);
    const uint64_t index = type >> 48;
    if (!asked.count({d, c})) __builtin_trap();
    if (index == 0) {
      if (next != count) __builtin_trap();  // the record before ended early
      driver = d, channel = c, next = 0;
      count = (type >> 32) & 0xFFFF;
      if (count == 0) count = 1;
    } else if (d != driver || c != channel || index != next) {
      __builtin_trap();
    }
    if (++next > count) __builtin_trap();
  }
  if (next != count) __builtin_trap();
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fuzz::ScratchRoot("hub");  // whatever the reporting code writes or logs stays there
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 3) return 0;
  const uint8_t flags = data[0];
  const size_t registry_size = std::min<size_t>((size_t{data[1]} << 8) | data[2], size - 3);
  const std::string_view bytes(reinterpret_cast<const char*>(data) + 3, size - 3);
  const cf::Value registry_file = Parse(bytes.substr(0, registry_size));
  const cf::Value values_file = Parse(bytes.substr(registry_size));

  std::string error;
  const sim::Registry registry = sim::Registry::Load(registry_file, &error);
  sim::Service hub;
  hub.class_name = "IOReportHub";
  hub.id = 1;
  hub.user_client = "hub";
  for (const sim::Service& s : registry.services())
    if (s.user_client == "hub") {
      hub = s;
      break;
    }

  // The channels of every legend, as a subscriber would gather them.
  const cf::Value channels = IOReportCreateAggregate(kIOReportByDriver);
  for (const sim::Service& s : registry.services()) {
    const cf::Value& legend = s.properties.Get("IOReportLegend");
    if (!legend.IsNull()) (void)addLegendChannels(channels, legend, s.id, cf::Value(s.name), nullptr);
  }
  std::vector<std::pair<uint64_t, uint64_t>> interests;
  IOReportIterate(channels, [&](const cf::Dictionary& c) {
    interests.emplace_back(IOReportChannelGetDriverID(c), IOReportChannelGetChannelID(c));
    return 0;
  });
  if (flags & 1) interests.emplace_back(0xFFFFFFFFFFFFFFF0ull, 0x7FFFFFFF);
  if (flags & 2) {
    const size_t n = interests.size();
    for (size_t i = 0; i < n; ++i) interests.push_back(interests[i]);
  }
  const std::set<std::pair<uint64_t, uint64_t>> asked(interests.begin(), interests.end());
  std::vector<uint8_t> list(8 + 24 * interests.size(), 0);
  const uint32_t n = static_cast<uint32_t>(interests.size());
  std::memcpy(list.data(), &n, 4);
  for (size_t i = 0; i < interests.size(); ++i) {
    cf::StoreLE64(list.data() + 8 + 24 * i, interests[i].first);
    cf::StoreLE64(list.data() + 16 + 24 * i, interests[i].second);
  }

  HubFiles files(registry_file, values_file);
  std::unique_ptr<sim::UserClient> client = sim::CreateHubClient(hub, files);
  std::string_view mapped;
  const uint64_t token_in = 1;
  // Nothing is mapped or updated before the interests are known.
  if (client->MapMemory(1, &mapped) == sim::kIOReturnSuccess) __builtin_trap();
  if (Call(*client, kUpdate, &token_in, 1, nullptr, nullptr, nullptr) == sim::kIOReturnSuccess) __builtin_trap();

  if (Call(*client, kOpen, nullptr, 0, nullptr, nullptr, nullptr) != sim::kIOReturnSuccess) return 0;
  uint64_t token = 0;
  uint32_t outputs = 1;
  if (Call(*client, kConfigureInterests, nullptr, 0, &list, &token, &outputs) != sim::kIOReturnSuccess) return 0;
  if (outputs != 1) __builtin_trap();
  // One interest list per connection: a mapped buffer never moves.
  uint64_t again = 0;
  uint32_t again_outputs = 1;
  if (Call(*client, kConfigureInterests, nullptr, 0, &list, &again, &again_outputs) == sim::kIOReturnSuccess)
    __builtin_trap();

  if (Call(*client, kUpdate, &token, 1, nullptr, nullptr, nullptr) != sim::kIOReturnSuccess) return 0;
  if (client->MapMemory(static_cast<uint32_t>(token), &mapped) != sim::kIOReturnSuccess) return 0;
  CheckBuffer(mapped, asked);

  // What a subscriber makes of the buffer.
  std::optional<IOReportError> sample_error;
  const cf::Value samples = createSamplesFromBytes(channels, mapped, &sample_error);
  IOReportIterate(samples, [](const cf::Dictionary& s) {
    // A state sample's description gives each state's duty cycle, a sum
    // over all states: time in the square of the count, seconds for the
    // 65535 states a legend may claim. Such samples are cut, not asked.
    if (IOReportStateGetCount(s) <= 1024) fuzz::AskSample(s);
    return 0;
  });
  return 0;
}
