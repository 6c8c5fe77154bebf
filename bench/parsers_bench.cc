// Parser benchmarks: a complete FTL buffer (569 fields, 2,156 values) and a
// complete MSP buffer, each beside the floor of a plain loop that reads every
// word of the same buffer. Prints the ratios and the heap allocations per pair.
// The counting operator new below replaces the global one; GCC cannot see
// that its pointers go back to free() through the matching delete.
#pragma GCC diagnostic ignored "-Wmismatched-new-delete"

#include <benchmark/benchmark.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <new>
#include <string>

#include "nandinfo/helpers.h"
#include "parsers/parsers.h"
#include "sim/statistics_buffers.h"

namespace {

std::atomic<uint64_t> g_allocations{0};

const std::string& Ftl() {
  static const std::string buffer = sim::CompleteFtlBuffer();
  return buffer;
}
const std::string& Msp() {
  static const std::string buffer = sim::CompleteMspBuffer();
  return buffer;
}

template <typename Word>
uint64_t ReadEveryWord(const std::string& buffer) {
  uint64_t sum = 0;
  for (size_t i = 0; i + sizeof(Word) <= buffer.size(); i += sizeof(Word)) {
    Word w;
    std::memcpy(&w, buffer.data() + i, sizeof w);
    sum += w;
  }
  return sum;
}

void PerPairAllocations(benchmark::State& state, uint64_t before, size_t pairs) {
  state.counters["allocs/pair"] =
      static_cast<double>(g_allocations.load() - before) / static_cast<double>(state.iterations() * pairs);
}

void BM_FtlFloor(benchmark::State& state) {
  for (auto _ : state) benchmark::DoNotOptimize(ReadEveryWord<uint64_t>(Ftl()));
}
BENCHMARK(BM_FtlFloor);

void BM_FtlParseToDictionary(benchmark::State& state) {
  const uint64_t before = g_allocations.load();
  for (auto _ : state) {
    GenericParserCxt context;
    VSPFTLParseBufferToCxt(&context, Ftl().data(), static_cast<uint32_t>(Ftl().size()));
    benchmark::DoNotOptimize(CreateDictFromCxt(context));
  }
  PerPairAllocations(state, before, 2156 * 2);  // a pair in the context and an entry in the dictionary
}
BENCHMARK(BM_FtlParseToDictionary);

void BM_StatsParse(benchmark::State& state) {
  const uint64_t before = g_allocations.load();
  for (auto _ : state) {
    VSPParseCxt context;
    benchmark::DoNotOptimize(VSPParseBufferToCxt(&context, Ftl().data(), static_cast<uint32_t>(Ftl().size())));
  }
  PerPairAllocations(state, before, 2156);
}
BENCHMARK(BM_StatsParse);

void BM_MspFloor(benchmark::State& state) {
  for (auto _ : state) benchmark::DoNotOptimize(ReadEveryWord<uint32_t>(Msp()));
}
BENCHMARK(BM_MspFloor);

void BM_MspParse(benchmark::State& state) {
  const uint64_t before = g_allocations.load();
  for (auto _ : state) {
    GenericParserCxt context;
    benchmark::DoNotOptimize(VSPMSPParseBufferToCxt(&context, Msp().data(), static_cast<uint32_t>(Msp().size())));
  }
  PerPairAllocations(state, before, 254);
}
BENCHMARK(BM_MspParse);

// Keeps each run's time per iteration for the ratios.
class RatioReporter : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& r : runs) times[r.benchmark_name()] = r.GetAdjustedRealTime();
    ConsoleReporter::ReportRuns(runs);
  }
  std::map<std::string, double> times;
};

}  // namespace

void* operator new(size_t n) {
  g_allocations.fetch_add(1, std::memory_order_relaxed);
  if (void* p = std::malloc(n ? n : 1)) return p;
  throw std::bad_alloc();
}
void operator delete(void* p) noexcept { std::free(p); }
void operator delete(void* p, size_t) noexcept { std::free(p); }

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  RatioReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  auto ratio = [&](const char* a, const char* b) {
    if (reporter.times.count(a) && reporter.times.count(b) && reporter.times[b] > 0)
      std::printf("%-28s %8.1f x the floor\n", a, reporter.times[a] / reporter.times[b]);
  };
  ratio("BM_FtlParseToDictionary", "BM_FtlFloor");
  ratio("BM_StatsParse", "BM_FtlFloor");
  ratio("BM_MspParse", "BM_MspFloor");
  return 0;
}
