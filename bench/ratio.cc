// The counting operator new below replaces the global one; GCC cannot see
// that its pointers go back to free() through the matching delete.
#pragma GCC diagnostic ignored "-Wmismatched-new-delete"

#include "bench/ratio.h"

#include <malloc.h>

#include <cstdio>
#include <cstdlib>
#include <map>
#include <new>

namespace bench {

std::atomic<uint64_t> g_allocations{0};

void CountAllocations(benchmark::State& state, uint64_t before, double units, const char* name) {
  state.counters[name] =
      static_cast<double>(g_allocations.load() - before) / (static_cast<double>(state.iterations()) * units);
}

namespace {

// Keeps each run's time per iteration (in nanoseconds) and its counter.
class SummaryReporter : public benchmark::ConsoleReporter {
 public:
  explicit SummaryReporter(std::string counter) : counter_(std::move(counter)) {}
  struct Result {
    double time = 0;
    double allocations = -1;
  };
  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& r : runs) {
      // With repetitions, the summary takes each benchmark's median.
      const bool aggregate = r.run_type == Run::RT_Aggregate;
      if (aggregate && r.aggregate_name != "median") continue;
      Result& result = results[aggregate ? r.run_name.str() : r.benchmark_name()];
      result.time = r.GetAdjustedRealTime() / benchmark::GetTimeUnitMultiplier(r.time_unit);
      if (auto it = r.counters.find(counter_); it != r.counters.end()) result.allocations = it->second;
    }
    ConsoleReporter::ReportRuns(runs);
  }
  std::map<std::string, Result> results;

 private:
  std::string counter_;
};

}  // namespace

int RunWithSummary(int argc, char** argv, const char* counter, const std::vector<SummaryLine>& lines) {
  // Keep freed memory with the process between iterations. Otherwise the
  // allocator hands the top of the heap back to the kernel after nearly
  // every iteration, and the next one pays page faults for it: time that
  // depends on the machine and on how the heap happens to lie, not on the
  // code measured.
  mallopt(M_TRIM_THRESHOLD, 256 << 20);
  mallopt(M_MMAP_THRESHOLD, 256 << 20);
  benchmark::Initialize(&argc, argv);
  SummaryReporter reporter(counter);
  benchmark::RunSpecifiedBenchmarks(&reporter);
  std::printf("\n%-28s %12s %18s\n", "summary", "x reference", counter);
  for (const SummaryLine& l : lines) {
    const auto it = reporter.results.find(l.benchmark), base = reporter.results.find(l.reference);
    if (it == reporter.results.end() || base == reporter.results.end() || base->second.time <= 0) continue;
    const double ratio = it->second.time / base->second.time;
    std::printf("%-28s %12.1f %18.4f", l.benchmark, ratio, it->second.allocations);
    if (l.limit > 0) std::printf("   (limit %.0fx: %s)", l.limit, ratio <= l.limit ? "within" : "OVER");
    std::printf("\n");
  }
  return 0;
}

}  // namespace bench

void* operator new(size_t n) {
  bench::g_allocations.fetch_add(1, std::memory_order_relaxed);
  if (void* p = std::malloc(n ? n : 1)) return p;
  throw std::bad_alloc();
}
void operator delete(void* p) noexcept { std::free(p); }
void operator delete(void* p, size_t) noexcept { std::free(p); }
