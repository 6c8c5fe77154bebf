// Parser benchmarks: a complete FTL buffer (569 fields, 2,156 values) and a
// complete MSP buffer (95 fields, 254 values), each beside the floor of a
// plain loop that reads every word of the same buffer. Ends with a summary:
// each benchmark's time as a multiple of its floor, and its heap
// allocations per pair.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstring>
#include <string>

#include "bench/ratio.h"

#include "nandinfo/helpers.h"
#include "parsers/parsers.h"
#include "sim/statistics_buffers.h"

namespace {

constexpr double kFtlPairs = 2156, kMspPairs = 254;
// The most the FTL parse plus its dictionary may take, in floors.
constexpr double kParseToDictionaryLimit = 30;

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
  bench::CountAllocations(state, before, pairs, "allocs/pair");
}

void BM_FtlFloor(benchmark::State& state) {
  for (auto _ : state) benchmark::DoNotOptimize(ReadEveryWord<uint64_t>(Ftl()));
}
BENCHMARK(BM_FtlFloor);

void BM_FtlParseToDictionary(benchmark::State& state) {
  const uint64_t before = bench::g_allocations.load();
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
  const uint64_t before = bench::g_allocations.load();
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
  const uint64_t before = bench::g_allocations.load();
  for (auto _ : state) benchmark::DoNotOptimize(CreateDictFromCxt(context));
  PerPairAllocations(state, before, kFtlPairs);
}
BENCHMARK(BM_FtlDictionary);

void BM_StatsParse(benchmark::State& state) {
  const uint64_t before = bench::g_allocations.load();
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
  const uint64_t before = bench::g_allocations.load();
  for (auto _ : state) {
    GenericParserCxt context;
    benchmark::DoNotOptimize(VSPMSPParseBufferToCxt(&context, Msp().data(), static_cast<uint32_t>(Msp().size())));
  }
  PerPairAllocations(state, before, kMspPairs);
}
BENCHMARK(BM_MspParse);

}  // namespace

int main(int argc, char** argv) {
  return bench::RunWithSummary(argc, argv, "allocs/pair",
                               {{"BM_FtlParseToDictionary", "BM_FtlFloor", kParseToDictionaryLimit},
                                {"BM_FtlParse", "BM_FtlFloor", 0},
                                {"BM_FtlDictionary", "BM_FtlFloor", 0},
                                {"BM_StatsParse", "BM_FtlFloor", 0},
                                {"BM_MspParse", "BM_MspFloor", 0}});
}
