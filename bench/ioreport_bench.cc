// Sample benchmarks: 10,000 channels of mixed formats (simple, array, state,
// histogram) from 40 drivers, and the hub's buffer for them in walk order.
// Cutting the buffer into samples and walking the samples (reading every
// value through the accessors) is timed beside the floor of a plain loop
// that reads the same buffer and sums each record's values. Ends with a
// summary: each benchmark's time as a multiple of the floor, and its heap
// allocations per channel.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstring>
#include <string>

#include "bench/ratio.h"

#include "ioreport/ioreport.h"
#include "ioreport/samples.h"

namespace {

constexpr int kDrivers = 40;
constexpr int kChannelsPerDriver = 250;
constexpr double kChannels = kDrivers * kChannelsPerDriver;

uint64_t Type(uint8_t format, uint16_t elements) {
  return static_cast<uint64_t>(IOReportChannelType(format, kIOReportCategoryField, elements));
}

// The channel's type by its place: simple, array, state and histogram in
// turn, with element counts that vary.
uint64_t TypeOf(int i) {
  switch (i % 4) {
    case 0: return Type(kIOReportFormatSimple, 1);
    case 1: return Type(kIOReportFormatSimpleArray, static_cast<uint16_t>(1 + i % 3));
    case 2: return Type(kIOReportFormatState, static_cast<uint16_t>(2 + i % 5));
    default: return Type(kIOReportFormatHistogram, static_cast<uint16_t>(4 + i % 9));
  }
}

struct Fixture {
  cf::Value channels;
  cf::Value raw;
  size_t records = 0;
  size_t elements = 0;
};

const Fixture& Data() {
  static const Fixture fixture = [] {
    Fixture f;
    f.channels = IOReportCreateAggregate(kIOReportByDriver | kIOReportByGroup);
    const cf::Value info = IOReportCreateUnitInfo(0x0100007c00000000);
    const cf::Value groups[] = {"Energy", "Power", "Latency", "Bandwidth"};
    for (int d = 0; d < kDrivers; ++d) {
      const uint64_t driver = 0x1000 + static_cast<uint64_t>(d);
      const cf::Value name("Driver" + std::to_string(d) + " <id " + std::to_string(driver) + ">");
      for (int c = 0; c < kChannelsPerDriver; ++c) {
        const int i = d * kChannelsPerDriver + c;
        IOReportAddChannelDescription(f.channels, driver, name, 0x100 + c, static_cast<int64_t>(TypeOf(i)),
                                      cf::Value("Channel" + std::to_string(c)), groups[c % 4],
                                      cf::Value("Sub" + std::to_string(c % 7)), info, nullptr);
      }
    }
    // The hub fills its buffer in the order of the interest list: walk order.
    std::string bytes;
    uint64_t time = 1;
    IOReportIterate(f.channels, [&](const cf::Dictionary& channel) {
      const uint64_t driver = static_cast<uint64_t>(IOReportChannelGetDriverID(channel));
      const uint64_t id = static_cast<uint64_t>(IOReportChannelGetChannelID(channel));
      uint64_t type = 0;
      if (const cf::Array* legend = channel.Get("LegendChannel").AsArray(); legend && legend->size() > 1)
        if (const cf::Number* n = (*legend)[1].AsNumber()) type = n->AsUInt64();
      const size_t n = (type >> 32) & 0xFFFF;
      for (size_t e = 0; e < n; ++e) {
        std::string element(kIOReportElementSize, '\0');
        std::memcpy(element.data(), &driver, 8);
        std::memcpy(element.data() + 8, &id, 8);
        std::memcpy(element.data() + 16, &type, 8);
        std::memcpy(element.data() + 24, &time, 8);
        for (int v = 0; v < 4; ++v) {
          const uint64_t value = time * 7 + static_cast<uint64_t>(v);
          std::memcpy(element.data() + 32 + 8 * v, &value, 8);
        }
        ++time;
        bytes += element;
      }
      ++f.records;
      f.elements += n;
      return kIOReportIterOk;
    });
    f.raw = cf::Value::Bytes(cf::Data(bytes.begin(), bytes.end()));
    return f;
  }();
  return fixture;
}

// The floor: every record's values summed, the element count read from the
// record's type as the cutting does.
uint64_t SumRecords(const cf::Data& raw) {
  uint64_t sum = 0;
  for (size_t at = 0; at + kIOReportElementSize <= raw.size();) {
    uint64_t type;
    std::memcpy(&type, raw.data() + at + 16, 8);
    const size_t count = (type >> 32) & 0xFFFF;
    if (count == 0 || count * kIOReportElementSize > raw.size() - at) break;
    for (size_t e = 0; e < count; ++e, at += kIOReportElementSize)
      for (size_t v = 0; v < 4; ++v) {
        uint64_t value;
        std::memcpy(&value, raw.data() + at + 32 + 8 * v, 8);
        sum += value;
      }
  }
  return sum;
}

// One sample's values through the accessors of its format.
uint64_t SumSample(const cf::Dictionary& s) {
  uint64_t sum = 0;
  switch (IOReportChannelGetFormat(s)) {
    case kIOReportFormatSimple:
      sum += static_cast<uint64_t>(IOReportSimpleGetIntegerValue(s, nullptr));
      break;
    case kIOReportFormatSimpleArray: {
      const cf::Data* raw = s.Get("RawElements").AsData();
      const int values = raw ? static_cast<int>(raw->size() / kIOReportElementSize * 4) : 0;
      for (int i = 0; i < values; ++i) sum += static_cast<uint64_t>(IOReportArrayGetValueAtIndex(s, i));
      break;
    }
    case kIOReportFormatState:
      for (int i = 0, n = IOReportStateGetCount(s); i < n; ++i)
        sum += static_cast<uint64_t>(IOReportStateGetIDForIndex(s, i) + IOReportStateGetInTransitions(s, i) +
                                     IOReportStateGetResidency(s, i));
      break;
    case kIOReportFormatHistogram:
      for (int i = 0, n = IOReportHistogramGetBucketCount(s); i < n; ++i)
        sum += static_cast<uint64_t>(IOReportHistogramGetBucketHits(s, i) + IOReportHistogramGetBucketMinValue(s, i) +
                                     IOReportHistogramGetBucketMaxValue(s, i) + IOReportHistogramGetBucketSum(s, i));
      break;
    default:
      break;
  }
  return sum;
}

uint64_t WalkSamples(const cf::Value& samples, size_t* visited) {
  uint64_t sum = 0;
  IOReportIterate(samples, [&](const cf::Dictionary& s) {
    sum += SumSample(s);
    ++*visited;
    return kIOReportIterOk;
  });
  return sum;
}

void PerChannelAllocations(benchmark::State& state, uint64_t before) {
  bench::CountAllocations(state, before, kChannels, "allocs/channel");
}

void BM_SamplesFloor(benchmark::State& state) {
  const Fixture& f = Data();
  for (auto _ : state) benchmark::DoNotOptimize(SumRecords(*f.raw.AsData()));
}
BENCHMARK(BM_SamplesFloor);

void BM_CreateSamplesAndIterate(benchmark::State& state) {
  const Fixture& f = Data();
  size_t visited = 0;
  const uint64_t before = bench::g_allocations.load();
  for (auto _ : state) {
    visited = 0;
    const cf::Value samples = IOReportCreateSamplesRaw(f.channels, f.raw, nullptr);
    benchmark::DoNotOptimize(WalkSamples(samples, &visited));
  }
  PerChannelAllocations(state, before);
  if (visited != f.records) state.SkipWithError("not every channel got its sample");
}
BENCHMARK(BM_CreateSamplesAndIterate)->Unit(benchmark::kMicrosecond);

// The two halves of the above on their own.
void BM_CreateSamples(benchmark::State& state) {
  const Fixture& f = Data();
  const uint64_t before = bench::g_allocations.load();
  for (auto _ : state) benchmark::DoNotOptimize(IOReportCreateSamplesRaw(f.channels, f.raw, nullptr));
  PerChannelAllocations(state, before);
}
BENCHMARK(BM_CreateSamples)->Unit(benchmark::kMicrosecond);

void BM_IterateSamples(benchmark::State& state) {
  const Fixture& f = Data();
  const cf::Value samples = IOReportCreateSamplesRaw(f.channels, f.raw, nullptr);
  size_t visited = 0;
  const uint64_t before = bench::g_allocations.load();
  for (auto _ : state) {
    visited = 0;
    benchmark::DoNotOptimize(WalkSamples(samples, &visited));
  }
  PerChannelAllocations(state, before);
}
BENCHMARK(BM_IterateSamples)->Unit(benchmark::kMicrosecond);

}  // namespace

int main(int argc, char** argv) {
  const Fixture& f = Data();
  std::printf("%d channels, %zu records, %zu elements, %zu bytes\n", IOReportGetChannelCount(f.channels), f.records,
              f.elements, f.raw.AsData()->size());
  return bench::RunWithSummary(argc, argv, "allocs/channel",
                               {{"BM_CreateSamplesAndIterate", "BM_SamplesFloor", 0},
                                {"BM_CreateSamples", "BM_SamplesFloor", 0},
                                {"BM_IterateSamples", "BM_SamplesFloor", 0}});
}
