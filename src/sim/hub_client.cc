// The reporting hub's user client, answering from ioreport.plist.
//
// Selector 0 opens, selector 2 takes the interest list (n, then n records
// of driver ID, channel ID and type) and answers the buffer token, and
// selector 3 refills the shared buffer that the token maps. Each channel
// the hub can find in its driver's "IOReportLegend" gets a record of as many
// 64-byte elements as the legend's type says, carrying that type; a channel
// it cannot find gets no record.
//
// ioreport.plist: driver entry ID (decimal text) → channel ID (decimal
// text) → a number (the first value of the first element) or an array with
// one entry per element, each [v0, v1, v2, v3] or {"values": [...], "time":
// t}. Anything missing reads as 0. The hub service's "failSelectors" (an
// array of selector numbers) and "failMap" (a boolean) break those calls.
#include <cstring>

#include "cf/bytes.h"
#include "sim/device.h"
#include "sim/user_clients.h"

namespace sim {

namespace {

constexpr uint32_t kBufferToken = 1;
constexpr size_t kElementSize = 64;
// The largest interest list the hub takes: its size must fit 32 bits.
constexpr uint64_t kMaxInterests = 89478478;
// The largest shared buffer it keeps; legends may claim 65535 elements a
// channel, and an interest list may name a channel many times.
constexpr size_t kMaxBuffer = size_t{64} << 20;

struct Interest {
  uint64_t driver_id = 0;
  uint64_t channel_id = 0;
  uint64_t type = 0;
};

int64_t NumberOr0(const cf::Value& v) {
  const cf::Number* n = v.AsNumber();
  return n ? n->AsSInt64() : 0;
}

// The type of a channel as its driver's legend gives it.
std::optional<uint64_t> LegendType(const Registry& registry, uint64_t driver_id, uint64_t channel_id) {
  const cf::Value legend = registry.Property(driver_id, "IOReportLegend", false);
  const cf::Array* entries = legend.AsArray();
  if (!entries) return std::nullopt;
  for (const cf::Value& entry : *entries) {
    const cf::Dictionary* d = entry.AsDictionary();
    const cf::Array* channels = d ? d->Get("IOReportChannels").AsArray() : nullptr;
    if (!channels) continue;
    for (const cf::Value& channel : *channels) {
      const cf::Array* c = channel.AsArray();
      if (!c || c->size() < 2 || !c->at(0).AsNumber() || !c->at(1).AsNumber()) continue;
      if (c->at(0).AsNumber()->AsUInt64() == channel_id) return c->at(1).AsNumber()->AsUInt64();
    }
  }
  return std::nullopt;
}

class HubClient : public UserClient {
 public:
  HubClient(const Service& service, DeviceFiles& files) : files_(files), properties_(service.properties) {}

  kern_return_t CallMethod(MethodCall& call) override {
    if (Fails(call.selector)) return kIOReturnError;
    switch (call.selector) {
      case 0: return kIOReturnSuccess;
      case 2: return ConfigureInterests(call);
      case 3: return Update(call);
      default: return kIOReturnUnsupported;
    }
  }

  kern_return_t MapMemory(uint32_t type, std::string_view* bytes) override {
    if (const cf::Value& fail = properties_.Get("failMap"); fail.AsBool() && *fail.AsBool()) return kIOReturnError;
    if (type != kBufferToken || !configured_) return kIOReturnBadArgument;
    *bytes = std::string_view(reinterpret_cast<const char*>(buffer_.data()), buffer_.size());
    return kIOReturnSuccess;
  }

 private:
  bool Fails(uint32_t selector) const {
    if (const cf::Array* list = properties_.Get("failSelectors").AsArray())
      for (const cf::Value& v : *list)
        if (const cf::Number* n = v.AsNumber(); n && !n->IsFloat() && n->AsSInt64() == selector) return true;
    return false;
  }

  kern_return_t ConfigureInterests(MethodCall& call) {
    // One interest list per connection: the buffer a client has mapped must
    // not move under it.
    if (configured_) return kIOReturnBadArgument;
    if (!call.struct_in || call.struct_in_size < 8 || !call.scalar_out || *call.scalar_out_count < 1)
      return kIOReturnBadArgument;
    const auto* in = static_cast<const uint8_t*>(call.struct_in);
    uint32_t n;
    std::memcpy(&n, in, 4);
    if (n >= kMaxInterests || call.struct_in_size != 8 + 24 * static_cast<size_t>(n)) return kIOReturnBadArgument;
    std::string error;
    const Registry registry = Registry::Load(files_.Read("registry.plist"), &error);
    records_.clear();
    size_t total = 0;
    for (uint32_t k = 0; k < n; ++k) {
      const uint8_t* entry = in + 8 + 24 * static_cast<size_t>(k);
      Interest interest{cf::LoadLE64(entry), cf::LoadLE64(entry + 8), cf::LoadLE64(entry + 16)};
      const auto type = LegendType(registry, interest.driver_id, interest.channel_id);
      if (!type) continue;  // the hub knows no such channel
      interest.type = *type;
      total += Elements(interest) * kElementSize;
      if (total > kMaxBuffer) {
        records_.clear();
        configured_ = false;
        return kIOReturnNoMemory;
      }
      records_.push_back(interest);
    }
    buffer_.assign(total, 0);
    configured_ = true;
    call.scalar_out[0] = kBufferToken;
    *call.scalar_out_count = 1;
    return kIOReturnSuccess;
  }

  // A record always has one element, even when its type counts none, so
  // that a reader meets the count its legend gives.
  static size_t Elements(const Interest& interest) {
    const size_t count = (interest.type >> 32) & 0xFFFF;
    return count == 0 ? 1 : count;
  }

  kern_return_t Update(MethodCall& call) {
    if (call.scalar_in_count != 1 || call.scalar_in[0] != kBufferToken || !configured_) return kIOReturnBadArgument;
    const cf::Value values = files_.Read("ioreport.plist");
    const cf::Dictionary* drivers = values.AsDictionary();
    uint8_t* p = buffer_.data();
    for (const Interest& interest : records_) {
      cf::Value answer;
      if (drivers)
        if (const cf::Dictionary* channels = drivers->Get(std::to_string(interest.driver_id)).AsDictionary())
          answer = channels->Get(std::to_string(interest.channel_id));
      const size_t count = Elements(interest);
      for (size_t e = 0; e < count; ++e, p += kElementSize) {
        std::memset(p, 0, kElementSize);
        cf::StoreLE64(p, interest.driver_id);
        cf::StoreLE64(p + 8, interest.channel_id);
        // The element's own index sits in the type's top 16 bits.
        cf::StoreLE64(p + 16, (interest.type & 0x0000FFFFFFFFFFFFull) | (static_cast<uint64_t>(e & 0xFFFF) << 48));
        int64_t slots[4] = {0, 0, 0, 0};
        int64_t time = 0;
        if (const cf::Array* per_element = answer.AsArray()) {
          cf::Value element = per_element->at(e);
          if (const cf::Dictionary* d = element.AsDictionary()) {
            time = NumberOr0(d->Get("time"));
            element = d->Get("values");
          }
          if (const cf::Array* a = element.AsArray())
            for (size_t i = 0; i < 4; ++i) slots[i] = NumberOr0(a->at(i));
        } else if (e == 0) {
          slots[0] = NumberOr0(answer);
        }
        cf::StoreLE64(p + 24, static_cast<uint64_t>(time));
        for (size_t i = 0; i < 4; ++i) cf::StoreLE64(p + 32 + 8 * i, static_cast<uint64_t>(slots[i]));
      }
    }
    return kIOReturnSuccess;
  }

  DeviceFiles& files_;
  cf::Dictionary properties_;
  std::vector<Interest> records_;
  std::vector<uint8_t> buffer_;
  bool configured_ = false;
};

}  // namespace

std::unique_ptr<UserClient> CreateHubClient(const Service& service, DeviceFiles& files) {
  return std::make_unique<HubClient>(service, files);
}

}  // namespace sim
