// A driver's legend and the hub's buffer as a driver might publish them:
// one byte of aggregate options, a 16-bit big-endian legend length, the
// legend as a property list, then raw sample bytes. Everything a channel
// or a sample can be asked is asked.
#include <string_view>

#include "cf/plist.h"
#include "ioreport/ioreport.h"
#include "ioreport/samples.h"
#include "ioreport_ask.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 3) return 0;
  const uint32_t options = data[0] & 3;
  const size_t legend_size = std::min<size_t>((size_t{data[1]} << 8) | data[2], size - 3);
  const std::string_view bytes(reinterpret_cast<const char*>(data) + 3, size - 3);
  const cf::ParseResult parsed = cf::ParsePropertyList(bytes.substr(0, legend_size));
  if (!parsed.ok()) return 0;
  cf::Value aggregate = IOReportCreateAggregate(options);
  std::optional<IOReportError> error;
  (void)addLegendChannels(aggregate, parsed.value, 0x10, "D <id 0x10>", &error);
  IOReportIterate(aggregate, [](const cf::Dictionary& c) {
    fuzz::AskChannel(c);
    return 0;
  });
  const cf::Value samples = createSamplesFromBytes(aggregate, bytes.substr(legend_size), &error);
  IOReportIterate(samples, [](const cf::Dictionary& s) {
    fuzz::AskSample(s);
    return 0;
  });
  (void)IOReportCreateSamplesDelta(samples, samples, nullptr);
  cf::Value merged = IOReportCreateAggregate(options ^ 3);
  (void)IOReportMergeChannels(merged, aggregate, nullptr);
  (void)IOReportPrune(merged, [](const cf::Dictionary& c) { return IOReportChannelGetFormat(c) == 1 ? 0 : 16; });
  (void)IOReportSelectChannelsInGroup(aggregate, "G", {}, nullptr);
  return 0;
}
