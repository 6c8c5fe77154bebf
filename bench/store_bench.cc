// Store history benchmark: streams one day of a large store through the
// history with a one-pass summary per distribution key, and times the sqlite3
// shell computing the same aggregates with GROUP BY on the same file.
//
//   store_bench [--keys N] [--samples N] [--scalars N] [--dir DIR]
//   store_bench --stream-only PATH   (one streaming pass; used for peak memory)
#include <unistd.h>

#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "bench_util.h"
#include "platform/history.h"
#include "platform/store.h"

namespace {

constexpr int32_t kDay = 20000;

struct Summary {
  uint64_t count = 0;
  double min = 0, max = 0, mean = 0, m2 = 0;
  void Add(double v) {
    ++count;
    if (count == 1 || v < min) min = v;
    if (count == 1 || v > max) max = v;
    const double delta = v - mean;
    mean += delta / static_cast<double>(count);
    m2 += delta * (v - mean);
  }
};

// One pass over every scalar and sample of the day; returns a checksum so the
// work cannot be optimised away.
double StreamDay(const std::string& path) {
  auto history = platform::TBHistory::initWithPath(path);
  if (!history) {
    std::fprintf(stderr, "cannot open %s\n", path.c_str());
    std::exit(1);
  }
  double check = 0;
  history->scalarsForKeyPrefix("", kDay - 1, kDay, [&](const std::string&, int32_t, int64_t v, bool*) {
    check += static_cast<double>(v);
  });
  history->distributionsForKeyPrefix("", kDay - 1, kDay,
                                     [&](const std::string&, int32_t, platform::TBHistoryDistributionEnumerator& e, bool*) {
                                       Summary s;
                                       double v;
                                       int32_t offset;
                                       while (e.getNextValue(&v, &offset)) s.Add(v);
                                       check += s.mean + s.m2 * 1e-12 + static_cast<double>(s.count);
                                     });
  return check;
}

// Peak resident memory of one streaming pass in a fresh process.
long PeakKiB(const char* self, const std::string& path) { return bench::Run({self, "--stream-only", path}).peak_kib; }

}  // namespace

int main(int argc, char** argv) {
  if (argc == 3 && std::strcmp(argv[1], "--stream-only") == 0) {
    return StreamDay(argv[2]) == 0.123 ? 1 : 0;
  }
  int keys = 1000, samples = 10000, scalars = 10000;
  std::string dir;
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string flag = argv[i];
    if (flag == "--keys") keys = std::atoi(argv[i + 1]);
    else if (flag == "--samples") samples = std::atoi(argv[i + 1]);
    else if (flag == "--scalars") scalars = std::atoi(argv[i + 1]);
    else if (flag == "--dir") dir = argv[i + 1];
  }
  bool own_dir = false;
  if (dir.empty()) {
    std::string tmpl = (std::filesystem::temp_directory_path() / "store-bench-XXXXXX").string();
    dir = mkdtemp(tmpl.data());
    own_dir = true;
  }
  const std::string big = dir + "/big.sqlitedb";
  const std::string small = dir + "/small.sqlitedb";

  auto t = std::chrono::steady_clock::now();
  bench::Fill(big, kDay, scalars, keys, samples);
  std::printf("filled %d scalars and %d keys x %d samples in %.1f s\n", scalars, keys, samples, bench::Seconds(t));
  const int small_keys = std::max(1, keys / 10);
  bench::Fill(small, kDay, 0, small_keys, samples);

  double ours = 1e9, shell = 1e9, check = 0;
  for (int round = 0; round < 3; ++round) {
    t = std::chrono::steady_clock::now();
    check += StreamDay(big);
    ours = std::min(ours, bench::Seconds(t));
    const bench::ProcessRun reference = bench::Run(bench::ShellAggregates(big, kDay));
    if (reference.status != 0) {
      std::fprintf(stderr, "the sqlite3 shell failed\n");
      return 1;
    }
    shell = std::min(shell, reference.seconds);
  }
  std::printf("history stream + summaries: %.3f s (best of 3)\n", ours);
  std::printf("sqlite3 shell GROUP BY:     %.3f s (best of 3)\n", shell);
  std::printf("ratio (ours / shell):       %.2f\n", ours / shell);
  std::printf("peak memory, %lld samples:  %ld KiB\n", static_cast<long long>(small_keys) * samples,
              PeakKiB(argv[0], small));
  std::printf("peak memory, %lld samples:  %ld KiB\n", static_cast<long long>(keys) * samples,
              PeakKiB(argv[0], big));
  if (check == 0.123) std::printf("\n");
  if (own_dir) std::filesystem::remove_all(dir);
  return 0;
}
