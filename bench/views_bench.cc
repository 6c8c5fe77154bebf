// The analytics views on the default storage device. BM_AnalyticsDay is one
// full analytics-day CopyNANDInfoWithOptions(1), as a fresh process runs it
// (controller fetches, parses, the whitelisted views, every event written),
// beside a store day on the same device. BM_FtlFilter cuts the FTL
// statistics (2,156 fields) down to the 931-entry whitelist, beside a plain
// copy of the same dictionary.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <memory>
#include <string>
#include <thread>

#include "../tests/temp_dir.h"
#include "bench/ratio.h"
#include "cf/plist.h"
#include "nandinfo/controller.h"
#include "nandinfo/helpers.h"
#include "nandinfo/nandinfo.h"
#include "nandinfo/view_tables.h"
#include "parsers/context.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "sim/default_device.h"

namespace {

constexpr double kDay = 20000;  // even: boot session "8..." makes it an analytics day

// A root holding the default storage device, in scope while it lives.
class Device {
 public:
  explicit Device(const char* boot_session) {
    platform::Backends backends{clock_, std::make_shared<platform::CaptureLog>()};
    scope_ = std::make_unique<platform::ContextScope>(root_.path(), backends);
    const sim::DefaultDevice device = sim::DefaultStorageDevice();
    cf::Dictionary sysctl;
    sysctl.Set("kern.bootsessionuuid", boot_session);
    for (const auto& [name, value] : std::vector<std::pair<std::string, cf::Value>>{
             {"device/registry.plist", device.registry},
             {"device/controller.plist", device.controller},
             {"device/stackshot.plist", device.stackshot},
             {"device/purgeable.plist", device.purgeable},
             {"device/ean.plist", device.ean},
             {"device/sysctl.plist", sysctl},
             {"var/eventlens/enabled-events.plist", cf::Value("*")}}) {
      std::string bytes;
      if (!cf::WriteXMLPropertyList(value, bytes, nullptr) || !platform::WriteFileAtomically(root_ / name, bytes)) {
        std::fprintf(stderr, "cannot write %s\n", name.c_str());
        std::exit(1);
      }
    }
  }
  // Forgets what a process keeps (the FTL statistics, the last error) and
  // the events already written.
  void NewProcess() {
    nandinfo::testing::ResetControllerState();
    parsers::testing::ResetAPIErrorMessage();
    platform::WriteFileAtomically(root_ / "var/eventlens/events.jsonl", "");
  }

 private:
  TempDir root_;
  std::shared_ptr<platform::FixedClock> clock_ = std::make_shared<platform::FixedClock>(kDay * 86400 + 3600);
  std::unique_ptr<platform::ContextScope> scope_;
};

// Allocations are counted per value of the FTL statistics.
constexpr double kFtlValues = 2156;

void RunDay(benchmark::State& state, const char* boot_session) {
  Device device(boot_session);
  const uint64_t before = bench::g_allocations.load();
  for (auto _ : state) {
    state.PauseTiming();
    device.NewProcess();
    state.ResumeTiming();
    benchmark::DoNotOptimize(CopyNANDInfoWithOptions(1));
  }
  bench::CountAllocations(state, before, kFtlValues, "allocs/field");
}

void BM_AnalyticsDay(benchmark::State& state) { RunDay(state, "8C0FFEE0-0000-4000-8000-000000000000"); }
BENCHMARK(BM_AnalyticsDay)->Unit(benchmark::kMillisecond);

void BM_StoreDay(benchmark::State& state) { RunDay(state, "7C0FFEE0-0000-4000-8000-000000000000"); }
BENCHMARK(BM_StoreDay)->Unit(benchmark::kMillisecond);

// The FTL statistics as the controller gives them, and the whitelist.
struct FtlView {
  Device device{"7"};
  cf::Value ftl = gatherVSPFTLData();
  cf::Value digits = [] {
    cf::Dictionary d;
    for (const nandinfo::SigDigits& row : nandinfo::WhitelistedRawNANDFTLCounters())
      d.Set(cf::Value(row.name), cf::Value::SInt32(row.digits));
    return cf::Value(d);
  }();
};

void BM_FtlFilter(benchmark::State& state) {
  FtlView view;
  const uint64_t before = bench::g_allocations.load();
  for (auto _ : state) benchmark::DoNotOptimize(CreateFilteredDict_SigDig(view.ftl, view.digits, true));
  bench::CountAllocations(state, before, static_cast<double>(view.ftl.AsDictionary()->size()), "allocs/field");
}
BENCHMARK(BM_FtlFilter);

void BM_FtlCopy(benchmark::State& state) {
  FtlView view;
  const uint64_t before = bench::g_allocations.load();
  for (auto _ : state) benchmark::DoNotOptimize(view.ftl.MutableCopy());
  bench::CountAllocations(state, before, static_cast<double>(view.ftl.AsDictionary()->size()), "allocs/field");
}
BENCHMARK(BM_FtlCopy);

}  // namespace

int main(int argc, char** argv) {
  return bench::RunWithSummary(argc, argv, "allocs/field",
                               {{"BM_AnalyticsDay", "BM_StoreDay", 0}, {"BM_FtlFilter", "BM_FtlCopy", 0}});
}
