// Subscribing through the reporting hub and cutting its buffer into samples.
#include <cstring>
#include <optional>
#include <vector>

#include "cf/bytes.h"
#include "ioreport/internal.h"
#include "ioreport/samples.h"
#include "platform/log.h"

using namespace ioreport_internal;

namespace {

// The hub's methods.
constexpr uint32_t kIOReportUserClientOpen = 0;
constexpr uint32_t kIOReportUserClientConfigureInterests = 2;
constexpr uint32_t kIOReportUserClientUpdateKernelBuffer = 3;

// Interest lists of this many entries or more would not fit their size in 32 bits.
constexpr uint64_t kMaxInterests = 89478478;

// n, then (driver ID, channel ID, type) per channel in walk order; empty on
// failure.
std::vector<uint8_t> createInterestList(const cf::Value& channels, int n) {
  if (n <= 0 || static_cast<uint64_t>(n) >= kMaxInterests) return {};
  std::vector<uint8_t> list(8 + 24 * static_cast<size_t>(n), 0);
  const uint32_t count = static_cast<uint32_t>(n);
  std::memcpy(list.data(), &count, 4);
  int written = 0;
  const int r = IOReportIterate(channels, [&](const cf::Dictionary& channel) {
    const int64_t driver = IOReportChannelGetDriverID(channel);
    const int64_t id = IOReportChannelGetChannelID(channel);
    const auto type = channelType(channel);
    if (driver == kIOReportInvalidValue || id == kIOReportInvalidValue || !type || written >= n)
      return kIOReportIterFailed;
    uint8_t* entry = list.data() + 8 + 24 * static_cast<size_t>(written);
    cf::StoreLE64(entry, static_cast<uint64_t>(driver));
    cf::StoreLE64(entry + 8, static_cast<uint64_t>(id));
    cf::StoreLE64(entry + 16, *type);
    ++written;
    return kIOReportIterOk;
  });
  if ((r & kIOReportIterFailed) || written != n) return {};
  return list;
}

// What a log line says of a channel: driver, group, subgroup and name. The
// name comes first and everything is copied: asking for the name caches it in
// the channel dictionary, which may move the values a reference would hold.
struct LoggedChannel {
  explicit LoggedChannel(const cf::Dictionary& channel)
      : name(IOReportChannelGetChannelName(channel)),
        driver(channel.Get("DriverName")),
        group(IOReportChannelGetGroup(channel)),
        subgroup(IOReportChannelGetSubGroup(channel)) {}
  cf::Value name, driver, group, subgroup;
};

void logZeroElements(const cf::Dictionary& channel) {
  const LoggedChannel c(channel);
  platform::LogError("channel has zero elements! %@ -- %@ -- %@ -- %@", c.driver, c.group, c.subgroup, c.name);
}

}  // namespace

IOReportSubscription::~IOReportSubscription() {
  if (mapped_address) IOConnectUnmapMemory64(connection, static_cast<uint32_t>(buffer_token), mach_task_self(),
                                             mapped_address);
  if (connection) IOServiceClose(connection);
}

IOReportSubscriptionRef IOReportCreateSubscription(const void*, const cf::Value& channels, cf::Value* subscribed,
                                                   uint64_t, IOReportErrorOut error) {
  if (channels.IsNull() || !subscribed) {
    setError(error, kIOReturnBadArgument, "bad arguments");
    return nullptr;
  }
  const int n = IOReportGetChannelCount(channels);
  if (n <= 0) {
    setError(error, kIOReturnBadArgument, n < 0 ? "iteration error" : "no channels");
    return nullptr;
  }
  const std::vector<uint8_t> interests = createInterestList(channels, n);
  if (interests.empty()) {
    setError(error, kIOReturnNoMemory, "createInterestList() failed");
    return nullptr;
  }
  auto subscription = std::make_shared<IOReportSubscription>();
  const io_service_t hub = IOServiceGetMatchingService(kIOMainPortDefault, IOServiceMatching("IOReportHub"));
  if (!hub) {
    setError(error, kIOReturnNotFound);
    return nullptr;
  }
  io_connect_t connection = 0;
  IOReturn rc = IOServiceOpen(hub, mach_task_self(), 0, &connection);
  IOObjectRelease(hub);
  if (rc != kIOReturnSuccess) {
    setError(error, rc, "Could not open IOReportHub");
    return nullptr;
  }
  subscription->connection = connection;  // closed with the object from here on
  rc = IOConnectCallScalarMethod(connection, kIOReportUserClientOpen, nullptr, 0, nullptr, nullptr);
  if (rc != kIOReturnSuccess) {
    setError(error, rc, "kIOReportUserClientOpen failed");
    return nullptr;
  }
  uint64_t token = 0;
  uint32_t outputs = 1;
  rc = IOConnectCallMethod(connection, kIOReportUserClientConfigureInterests, nullptr, 0, interests.data(),
                           interests.size(), &token, &outputs, nullptr, nullptr);
  if (rc == kIOReturnSuccess && outputs != 1) rc = kIOReturnError;
  if (rc != kIOReturnSuccess) {
    setError(error, rc, "kIOReportUserClientConfigureInterests failed");
    return nullptr;
  }
  subscription->buffer_token = token;
  rc = IOConnectMapMemory64(connection, static_cast<uint32_t>(token), mach_task_self(),
                            &subscription->mapped_address, &subscription->mapped_size, kIOMapAnywhere);
  if (rc != kIOReturnSuccess) {
    subscription->mapped_address = 0;
    setError(error, rc, "IOConnectMapMemory() failed");
    return nullptr;
  }
  int r = 0;
  *subscribed = copyChannels(channels, [](const cf::Dictionary&, cf::Dictionary&) { return kIOReportIterOk; }, &r);
  return subscription;
}

cf::Value IOReportCreateSamples(const IOReportSubscriptionRef& subscription, const cf::Value& subscribed,
                                IOReportErrorOut error) {
  if (!subscription || subscribed.IsNull()) {
    setError(error, kIOReturnBadArgument);
    return cf::Value();
  }
  const uint64_t token = subscription->buffer_token;
  const IOReturn rc = IOConnectCallScalarMethod(subscription->connection, kIOReportUserClientUpdateKernelBuffer,
                                                &token, 1, nullptr, nullptr);
  if (rc != kIOReturnSuccess) {
    setError(error, rc, "_updateKernelBuffer() failed");
    return cf::Value();
  }
  const std::string_view bytes(reinterpret_cast<const char*>(subscription->mapped_address),
                               subscription->mapped_address ? subscription->mapped_size : 0);
  cf::Value samples = createSamplesFromBytes(subscribed, bytes, error);
  if (samples.IsNull()) setErrorIfEmpty(error, kIOReturnError, "unknown error");
  return samples;
}

cf::Value IOReportCreateSamplesRaw(const cf::Value& channels, const cf::Value& raw, IOReportErrorOut error) {
  const cf::Data* data = raw.AsData();
  if (channels.IsNull() || !data) {
    setError(error, kIOReturnBadArgument);
    return cf::Value();
  }
  return createSamplesFromBytes(channels, std::string_view(reinterpret_cast<const char*>(data->data()), data->size()),
                                error);
}

namespace {

// Where each channel's record begins: the first record of each (driver ID,
// channel ID) pair, found in one pass along the chain of records. The chain
// ends at the buffer's end, at a record that runs past it (which is kept:
// its channel fails) or at a record claiming no elements (which is not:
// every channel not found before it is logged as having none).
class RecordIndex {
 public:
  RecordIndex(const uint8_t* base, size_t usable) : base_(base) {
    std::vector<size_t> starts;
    for (size_t at = 0; at + kIOReportElementSize <= usable;) {
      const size_t count = (cf::LoadLE64(base + at + 16) >> 32) & 0xFFFF;
      if (count == 0) {
        ends_without_elements_ = true;
        break;
      }
      starts.push_back(at);
      at += count * kIOReportElementSize;
    }
    // Open addressing at most half full; slots hold offset + 1, 0 is empty.
    size_t capacity = 16;
    while (capacity < 2 * starts.size()) capacity *= 2;
    slots_.assign(capacity, 0);
    for (const size_t at : starts) {
      const uint64_t driver = cf::LoadLE64(base + at), id = cf::LoadLE64(base + at + 8);
      for (size_t s = slotOf(driver, id);; s = (s + 1) & (capacity - 1)) {
        if (slots_[s] == 0) {
          slots_[s] = at + 1;
          break;
        }
        if (matches(slots_[s] - 1, driver, id)) break;  // the first record of a channel wins
      }
    }
  }

  // The offset of the channel's record, if the chain holds one.
  std::optional<size_t> Find(uint64_t driver, uint64_t id) const {
    for (size_t s = slotOf(driver, id);; s = (s + 1) & (slots_.size() - 1)) {
      if (slots_[s] == 0) return std::nullopt;
      if (matches(slots_[s] - 1, driver, id)) return slots_[s] - 1;
    }
  }
  bool endsWithoutElements() const { return ends_without_elements_; }

 private:
  size_t slotOf(uint64_t driver, uint64_t id) const {
    uint64_t h = (driver * 0x9E3779B97F4A7C15ull) ^ id;
    h ^= h >> 29;
    h *= 0xBF58476D1CE4E5B9ull;
    h ^= h >> 32;
    return static_cast<size_t>(h) & (slots_.size() - 1);
  }
  bool matches(size_t at, uint64_t driver, uint64_t id) const {
    return cf::LoadLE64(base_ + at) == driver && cf::LoadLE64(base_ + at + 8) == id;
  }

  const uint8_t* base_;
  std::vector<size_t> slots_;
  bool ends_without_elements_ = false;
};

}  // namespace

cf::Value createSamplesFromBytes(const cf::Value& channels, std::string_view raw, IOReportErrorOut error) {
  if (raw.size() < kIOReportElementSize) {
    setError(error, kIOReturnBadArgument, "couldn't create samples");
    return cf::Value();
  }
  const auto* base = reinterpret_cast<const uint8_t*>(raw.data());
  // Trailing bytes short of a whole element are not read.
  const size_t usable = raw.size() / kIOReportElementSize * kIOReportElementSize;
  const RecordIndex index(base, usable);
  int r = 0;
  cf::Value samples = copyChannels(
      channels,
      [&](const cf::Dictionary& channel, cf::Dictionary& copy) {
        const uint64_t driver = static_cast<uint64_t>(IOReportChannelGetDriverID(channel));
        const uint64_t id = static_cast<uint64_t>(IOReportChannelGetChannelID(channel));
        const std::optional<size_t> at = index.Find(driver, id);
        if (!at) {
          if (index.endsWithoutElements()) logZeroElements(channel);
          return kIOReportIterSkipped;
        }
        const uint8_t* record = base + *at;
        const uint64_t type = cf::LoadLE64(record + 16);
        const size_t count = (type >> 32) & 0xFFFF;
        const size_t length = count * kIOReportElementSize;
        if (IOReportChannelGetFormat(channel) == kIOReportFormatUnknown) {
          // Channels asked for by ID learn their type from the first sample,
          // once: the legend is shared with the channel that was subscribed.
          if (const cf::Array* legend = channel.Get("LegendChannel").AsArray(); legend && legend->size() >= 2) {
            cf::Array shared = *legend;
            shared.Set(1, cf::Value::SInt64(static_cast<int64_t>(type)));
          }
        }
        if (length > usable - *at) {
          const LoggedChannel c(channel);
          platform::LogFault("absurd element count! nelems=%d, %@ -- %@ -- %@ -- %@", static_cast<int>(count), c.driver,
                             c.group, c.subgroup, c.name);
          setErrorIfEmpty(error, kIOReturnError, "absurd element count");
          return kIOReportIterFailed;
        }
        copy.Set("RawElements", cf::Value::Bytes(cf::Data(record, record + length)));
        return kIOReportIterOk;
      },
      &r);
  if (samples.IsNull()) setErrorIfEmpty(error, kIOReturnBadArgument, "couldn't create samples");
  return samples;
}
