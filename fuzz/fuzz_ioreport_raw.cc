// The hub's buffer as it might arrive: raw sample bytes cut against one
// fixed aggregate of channels of every format (made for each input), then
// everything a sample can be asked is asked of each sample.
//
// The aggregate, driver 0x10 throughout:
//   1  simple, one element, unit and group "G"/"g"
//   2  state, three elements
//   3  histogram, three buckets, with a bucket configuration
//   4  array, two elements
//   5  type unknown (learned from its first record)
//   6  state whose legend claims two elements
//   7  simple, in another group, with no name
#include <cstring>

#include "ioreport/ioreport.h"
#include "ioreport/samples.h"
#include "ioreport_ask.h"

namespace {

uint64_t Type(uint8_t format, uint16_t categories, uint16_t elements) {
  return static_cast<uint64_t>(IOReportChannelType(format, categories, elements));
}

// Made anew for every input: a channel of unknown type keeps the type its
// first sample gives it, and each input must start from the same channels.
cf::Value Channels() {
  return [] {
    cf::Value a = IOReportCreateAggregate(kIOReportByDriver | kIOReportByGroup);
    cf::Dictionary info;
    info.Set("IOReportChannelUnit", cf::Value::SInt64(0x0100007c00000000));
    const int32_t segments[] = {10, 0, 0, 2, 2, 1, 1, 1};
    info.Set("IOReportChannelConfig", cf::Value::Bytes(cf::Data(reinterpret_cast<const uint8_t*>(segments),
                                                                reinterpret_cast<const uint8_t*>(segments) + 32)));
    const cf::Value driver("D <id 0x10>");
    auto add = [&](int64_t id, uint64_t type, const cf::Value& name, const cf::Value& group, const cf::Value& subgroup) {
      IOReportAddChannelDescription(a, 0x10, driver, id, static_cast<int64_t>(type), name, group, subgroup, info,
                                    nullptr);
    };
    add(1, Type(1, 0x100, 1), "Total", "G", "g");
    add(2, Type(2, 0x100, 3), "Power", "G", "g");
    add(3, Type(3, 0x100, 3), "Latency", "G", {});
    add(4, Type(4, 0x100, 2), "Lanes", {}, {});
    add(5, 0, {}, {}, {});
    add(6, Type(2, 0x100, 2), "Short", "G", "g");
    add(7, Type(1, 0x200, 1), {}, "H", {});
    return a;
  }();
}


}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const cf::Value raw = cf::Value::Bytes(cf::Data(data, data + size));
  std::optional<IOReportError> error;
  const cf::Value samples = IOReportCreateSamplesRaw(Channels(), raw, &error);
  if (error) (void)error->Description();
  IOReportIterate(samples, [](const cf::Dictionary& s) {
    fuzz::AskSample(s);
    return 0;
  });
  const cf::Value delta = IOReportCreateSamplesDelta(samples, samples, nullptr);
  IOReportIterate(delta, [](const cf::Dictionary& s) {
    fuzz::AskSample(s);
    return 0;
  });
  return 0;
}
