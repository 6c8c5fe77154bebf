// What the micro-benchmarks share: a count of heap allocations (this
// library replaces operator new), and a closing summary of each benchmark's
// time as a multiple of a reference run on the same data, with its
// allocations per unit of work.
#pragma once

#include <benchmark/benchmark.h>

#include <atomic>
#include <cstdint>
#include <string>
#include <vector>

namespace bench {

// Every operator new of the process so far.
extern std::atomic<uint64_t> g_allocations;

// Sets the counter `name` to the allocations since before, per iteration
// and per unit (a pair, a channel) of the work measured.
void CountAllocations(benchmark::State& state, uint64_t before, double units, const char* name);

struct SummaryLine {
  const char* benchmark;
  const char* reference;
  double limit;  // at most this many references; 0: no limit
};

// Runs the benchmarks named on the command line, then prints one summary
// line per entry: the ratio to its reference and the allocations counter.
int RunWithSummary(int argc, char** argv, const char* counter, const std::vector<SummaryLine>& lines);

}  // namespace bench
