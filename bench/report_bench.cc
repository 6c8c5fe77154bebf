// Report benchmark: `tallyrun -f` over a large whitelisted day (whitelist
// loading, history scan, summaries, histograms, serialization, submission)
// against the sqlite3 shell computing the same aggregates on the same file.
//
//   report_bench TALLYRUN_BINARY [--keys N] [--samples N] [--scalars N]
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "bench_util.h"
#include "cf/plist.h"
#include "platform/files.h"
#include "sim/default_device.h"

namespace {

constexpr int32_t kYesterday = 20000;
const char* kNow = "1728086400";  // the start of day 20001, UTC

void WriteWhitelist(const std::string& root, int scalars, int keys) {
  cf::Dictionary scalar_keys, dist_keys;
  cf::Dictionary shaped;
  shaped.Set("bucket_interval", cf::Value::SInt64(10));
  shaped.Set("sig_fig", cf::Value::SInt64(2));
  for (int i = 0; i < scalars; ++i) scalar_keys.Set(bench::ScalarKey(i), i % 2 ? cf::Dictionary() : shaped);
  cf::Array bounds;
  for (int b : {10, 50, 100, 250, 500, 750}) bounds.Append(cf::Value::SInt64(b));
  cf::Dictionary with_histogram;
  with_histogram.Set("intervals", bounds);
  for (int k = 0; k < keys; ++k) dist_keys.Set(bench::DistributionKey(k), k % 10 == 0 ? with_histogram : cf::Dictionary());
  cf::Dictionary group;
  group.Set("ScalarKeys", scalar_keys);
  group.Set("DistributionKeys", dist_keys);
  cf::Dictionary whitelist;
  whitelist.Set("Bench", group);
  std::string bytes;
  if (!cf::WriteXMLPropertyList(whitelist, bytes, nullptr) ||
      !platform::WriteFileAtomically(root + "/Library/Application Support/Tallybook/Whitelist_boxOS.plist", bytes)) {
    std::fprintf(stderr, "cannot write the whitelist\n");
    std::exit(1);
  }
}

// The default storage device, on a day that writes the store's NAND keys:
// the boot session's first digit is even and day 20001 is odd.
void WriteDevice(const std::string& root) {
  const sim::DefaultDevice device = sim::DefaultStorageDevice();
  cf::Dictionary sysctl;
  sysctl.Set("kern.bootsessionuuid", "6" + device.boot_session_uuid.substr(1));
  for (const auto& [name, value] : std::vector<std::pair<const char*, cf::Value>>{
           {"registry", device.registry}, {"controller", device.controller}, {"stackshot", device.stackshot},
           {"purgeable", device.purgeable}, {"sysctl", sysctl}}) {
    std::string bytes;
    if (!cf::WriteXMLPropertyList(value, bytes, nullptr) ||
        !platform::WriteFileAtomically(root + "/device/" + name + ".plist", bytes)) {
      std::fprintf(stderr, "cannot write the device\n");
      std::exit(1);
    }
  }
}

bench::ProcessRun TimeReport(const std::string& tallyrun, const std::string& root) {
  std::filesystem::remove_all(root + "/var/diagvault");
  std::filesystem::remove_all(root + "/Library/Preferences");
  const bench::ProcessRun r = bench::Run({tallyrun, "-f"}, {{"TALLYRUN_ROOT", root}, {"TALLYRUN_NOW", kNow}, {"TZ", "UTC0"}});
  if (r.status != 0 || !std::filesystem::exists(root + "/var/diagvault/submissions")) {
    std::fprintf(stderr, "tallyrun -f wrote no log\n");
    std::exit(1);
  }
  return r;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2) {
    std::fprintf(stderr, "usage: report_bench TALLYRUN_BINARY [--keys N] [--samples N] [--scalars N]\n");
    return 2;
  }
  const std::string tallyrun = std::filesystem::absolute(argv[1]);
  int keys = 1000, samples = 10000, scalars = 10000;
  for (int i = 2; i + 1 < argc; i += 2) {
    const std::string flag = argv[i];
    if (flag == "--keys") keys = std::atoi(argv[i + 1]);
    else if (flag == "--samples") samples = std::atoi(argv[i + 1]);
    else if (flag == "--scalars") scalars = std::atoi(argv[i + 1]);
  }
  std::string tmpl = (std::filesystem::temp_directory_path() / "report-bench-XXXXXX").string();
  const std::string dir = mkdtemp(tmpl.data());
  const std::string big = dir + "/big", small = dir + "/small";
  const std::string store = platform::kStoreDevicePath;

  auto t = std::chrono::steady_clock::now();
  WriteWhitelist(big, scalars, keys);
  WriteWhitelist(small, scalars, keys);
  WriteDevice(big);
  WriteDevice(small);
  bench::Fill(big + store, kYesterday, scalars, keys, samples);
  bench::Fill(small + store, kYesterday, scalars, keys, std::max(1, samples / 10));
  std::printf("filled %d scalars and %d keys x %d samples (a tenth with histograms) in %.1f s\n", scalars, keys,
              samples, bench::Seconds(t));

  double ours = 1e9, shell = 1e9;
  long peak_big = 0;
  for (int round = 0; round < 3; ++round) {
    const bench::ProcessRun r = TimeReport(tallyrun, big);
    ours = std::min(ours, r.seconds);
    peak_big = std::max(peak_big, r.peak_kib);
    const bench::ProcessRun reference = bench::Run(bench::ShellAggregates(big + store, kYesterday));
    if (reference.status != 0) {
      std::fprintf(stderr, "the sqlite3 shell failed\n");
      return 1;
    }
    shell = std::min(shell, reference.seconds);
  }
  const bench::ProcessRun small_run = TimeReport(tallyrun, small);
  // What the controller's figures add to a run: the same small day with and
  // without the storage device.
  double with_device = 1e9, without_device = 1e9;
  for (int round = 0; round < 5; ++round) with_device = std::min(with_device, TimeReport(tallyrun, small).seconds);
  for (const char* name : {"registry", "controller", "stackshot", "purgeable"})
    std::filesystem::remove(small + "/device/" + name + ".plist");
  for (int round = 0; round < 5; ++round) without_device = std::min(without_device, TimeReport(tallyrun, small).seconds);
  std::printf("tallyrun -f:            %.3f s (best of 3)\n", ours);
  std::printf("sqlite3 shell GROUP BY: %.3f s (best of 3)\n", shell);
  std::printf("ratio (tallyrun / shell): %.2f\n", ours / shell);
  std::printf("the NAND step (%.3f s with the storage device, %.3f s without): %.1f ms\n", with_device,
              without_device, (with_device - without_device) * 1000);
  std::printf("peak memory of tallyrun, %lld samples: %ld KiB\n",
              static_cast<long long>(keys) * std::max(1, samples / 10), small_run.peak_kib);
  std::printf("peak memory of tallyrun, %lld samples: %ld KiB\n", static_cast<long long>(keys) * samples, peak_big);
  std::filesystem::remove_all(dir);
  return 0;
}
