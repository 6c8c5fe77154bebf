// Parser benchmarks: a complete FTL buffer (569 fields, 2,156 values) and a
// complete MSP buffer (95 fields, 254 values), each beside the floor of a
// plain loop that reads every word of the same buffer. Ends with a summary:
// each benchmark's time as a multiple of its floor, and its heap
// allocations per pair.
// The counting operator new below replaces the global one; GCC cannot see
// that its pointers go back to free() through the matching delete.
#pragma GCC diagnostic ignored "-Wmismatched-new-delete"

#include <benchmark/benchmark.h>
#include <malloc.h>

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

constexpr double kFtlPairs = 2156, kMspPairs = 254;
// The most the FTL parse plus its dictionary may take, in floors.
constexpr double kParseToDictionaryLimit = 30;

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

// Heap allocations per iteration divided by the pairs a parse yields.
void PerPairAllocations(benchmark::State& state, uint64_t before, double pairs) {
  state.counters["allocs/pair"] =
      static_cast<double>(g_allocations.load() - before) / (static_cast<double>(state.iterations()) * pairs);
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
  PerPairAllocations(state, before, kFtlPairs);
}
BENCHMARK(BM_FtlParseToDictionary);

// The two halves of the above on their own.
void BM_FtlParse(benchmark::State& state) {
  const uint64_t before = g_allocations.load();
  for (auto _ : state) {
    GenericParserCxt context;
    benchmark::DoNotOptimize(VSPFTLParseBufferToCxt(&context, Ftl().data(), static_cast<uint32_t>(Ftl().size())));
  }
  PerPairAllocations(state, before, kFtlPairs);
}
BENCHMARK(BM_FtlParse);

void BM_FtlDictionary(benchmark::State& state) {
  GenericParserCxt context;
  VSPFTLParseBufferToCxt(&context, Ftl().data(), static_cast<uint32_t>(Ftl().size()));
  const uint64_t before = g_allocations.load();
  for (auto _ : state) benchmark::DoNotOptimize(CreateDictFromCxt(context));
  PerPairAllocations(state, before, kFtlPairs);
}
BENCHMARK(BM_FtlDictionary);

void BM_StatsParse(benchmark::State& state) {
  const uint64_t before = g_allocations.load();
  for (auto _ : state) {
    VSPParseCxt context;
    benchmark::DoNotOptimize(VSPParseBufferToCxt(&context, Ftl().data(), static_cast<uint32_t>(Ftl().size())));
  }
  PerPairAllocations(state, before, kFtlPairs);
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
  PerPairAllocations(state, before, kMspPairs);
}
BENCHMARK(BM_MspParse);

// Keeps each run's time per iteration and allocations per pair.
class SummaryReporter : public benchmark::ConsoleReporter {
 public:
  struct Result {
    double time = 0;
    double allocations = -1;
  };
  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& r : runs) {
      Result& result = results[r.benchmark_name()];
      result.time = r.GetAdjustedRealTime();
      if (auto it = r.counters.find("allocs/pair"); it != r.counters.end()) result.allocations = it->second;
    }
    ConsoleReporter::ReportRuns(runs);
  }
  std::map<std::string, Result> results;
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
  // Keep freed memory with the process between iterations. Otherwise the
  // allocator hands the top of the heap back to the kernel after nearly
  // every iteration (the context and the dictionary together pass its
  // trimming threshold), and the next one pays page faults for it: tens of
  // microseconds that depend on the machine and on how the heap happens to
  // lie, not on the code measured.
  mallopt(M_TRIM_THRESHOLD, 256 << 20);
  mallopt(M_MMAP_THRESHOLD, 256 << 20);
  benchmark::Initialize(&argc, argv);
  SummaryReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  std::printf("\n%-26s %12s %18s\n", "summary", "x the floor", "allocations/pair");
  auto line = [&](const char* name, const char* floor, double limit) {
    const auto it = reporter.results.find(name), base = reporter.results.find(floor);
    if (it == reporter.results.end() || base == reporter.results.end() || base->second.time <= 0) return;
    const double ratio = it->second.time / base->second.time;
    std::printf("%-26s %12.1f %18.4f", name, ratio, it->second.allocations);
    if (limit > 0) std::printf("   (limit %.0fx: %s)", limit, ratio <= limit ? "within" : "OVER");
    std::printf("\n");
  };
  line("BM_FtlParseToDictionary", "BM_FtlFloor", kParseToDictionaryLimit);
  line("BM_FtlParse", "BM_FtlFloor", 0);
  line("BM_FtlDictionary", "BM_FtlFloor", 0);
  line("BM_StatsParse", "BM_FtlFloor", 0);
  line("BM_MspParse", "BM_MspFloor", 0);
  return 0;
}
