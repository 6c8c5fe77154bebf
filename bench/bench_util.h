// Shared pieces of the store and report benchmarks: filling a store with a
// large day, running a program and measuring it.
#pragma once

#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <string>
#include <vector>

#include "platform/store.h"

namespace bench {

inline double Seconds(std::chrono::steady_clock::time_point since) {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - since).count();
}

inline std::string ScalarKey(int i) { return "com.velmora.bench.scalar." + std::to_string(i); }
inline std::string DistributionKey(int i) { return "com.velmora.bench.dist." + std::to_string(i); }

// One day of scalars and distribution samples, repeatable from run to run.
inline void Fill(const std::string& path, int32_t day, int scalars, int keys, int samples) {
  std::string error;
  auto store = platform::TallyStore::Open(path, platform::TallyStore::Mode::kCreate, &error);
  if (!store) {
    std::fprintf(stderr, "%s\n", error.c_str());
    std::exit(1);
  }
  store->Batch([&] {
    for (int i = 0; i < scalars; ++i)
      if (!store->SetScalar(day, ScalarKey(i), 1000 + i)) return false;
    return true;
  });
  std::vector<std::pair<double, int32_t>> values(static_cast<size_t>(samples));
  uint64_t x = 88172645463325252ULL;
  for (int k = 0; k < keys; ++k) {
    for (auto& [v, off] : values) {
      x ^= x << 13, x ^= x >> 7, x ^= x << 17;  // xorshift: cheap, repeatable
      v = static_cast<double>(x % 100000) / 100.0;
      off = static_cast<int32_t>(x % 86400);
    }
    if (!store->PushSamples(day, DistributionKey(k), values)) {
      std::fprintf(stderr, "%s\n", store->last_error().c_str());
      std::exit(1);
    }
  }
  store->Checkpoint();
}

struct ProcessRun {
  int status = -1;
  double seconds = 0;
  long peak_kib = 0;
};

// Runs a program with extra environment, output discarded; wall time and
// the peak resident memory of that process alone.
inline ProcessRun Run(const std::vector<std::string>& argv, const std::map<std::string, std::string>& env = {}) {
  std::fflush(stdout);
  const auto start = std::chrono::steady_clock::now();
  const pid_t pid = fork();
  if (pid == 0) {
    if (!freopen("/dev/null", "w", stdout) || !freopen("/dev/null", "w", stderr)) _exit(126);
    for (const auto& [k, v] : env) setenv(k.c_str(), v.c_str(), 1);
    std::vector<char*> args;
    for (const auto& a : argv) args.push_back(const_cast<char*>(a.c_str()));
    args.push_back(nullptr);
    execvp(args[0], args.data());
    _exit(127);
  }
  ProcessRun r;
  int status = 0;
  struct rusage usage;
  wait4(pid, &status, 0, &usage);
  r.seconds = Seconds(start);
  r.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128;
  r.peak_kib = usage.ru_maxrss;
  return r;
}

// The reference: the sqlite3 shell computing count, min, max, avg and the
// sum of squares per key of one day, and reading that day's scalars.
inline std::vector<std::string> ShellAggregates(const std::string& path, int32_t day) {
  const std::string d = std::to_string(day);
  return {"sqlite3", path,
          "SELECT key, value FROM scalars WHERE day = " + d +
              ";"
              "SELECT s.key, count(*), min(value), max(value), avg(value), sum(value * value) "
              "FROM samples JOIN series s ON s.id = samples.series WHERE s.day = " +
              d + " GROUP BY samples.series;"};
}

}  // namespace bench
