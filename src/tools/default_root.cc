#include "tools/default_root.h"

#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <vector>

#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/store.h"

namespace {

cf::Dictionary Options(std::initializer_list<std::pair<const char*, cf::Value>> entries) {
  cf::Dictionary d;
  for (const auto& [k, v] : entries) d.Set(k, v);
  return d;
}

cf::Value Bounds(std::initializer_list<int64_t> bounds) {
  cf::Array a;
  for (int64_t b : bounds) a.Append(cf::Value::SInt64(b));
  return a;
}

cf::Dictionary Whitelist() {
  cf::Dictionary homedeck_scalars = Options({
      {"com.velmora.homedeck.Unlocks", cf::Dictionary()},
      {"com.velmora.homedeck.AppLaunches", Options({{"bucket_interval", cf::Value::SInt64(10)}})},
      {"com.velmora.homedeck.ScreenOnSeconds", Options({{"sig_fig", cf::Value::SInt64(2)}})},
  });
  cf::Dictionary homedeck_dists = Options({
      {"com.velmora.homedeck.AppLaunchTimeMs", Options({{"intervals", Bounds({100, 250, 500, 1000})}})},
  });
  cf::Dictionary power_scalars = Options({
      {"com.velmora.power.ChargeCycles", cf::Dictionary()},
      {"com.velmora.power.EnergyUsedmWh",
       Options({{"bucket_interval", cf::Value::SInt64(100)}, {"sig_fig", cf::Value::SInt64(3)}})},
  });
  cf::Dictionary power_dists = Options({
      {"com.velmora.power.BatteryTemperatureC", Options({{"intervals", Bounds({20, 30, 40})}})},
  });
  cf::Dictionary network = Options({
      {"ScalarKeyPrefixes", Options({{"com.velmora.wifi.", cf::Dictionary()}})},
      {"DistributionKeyPrefixes", Options({{"com.velmora.net.", cf::Dictionary()}})},
      {"DistributionKeys",
       Options({{"com.velmora.net.DNSLatencyMs", Options({{"intervals", Bounds({10, 50, 100, 500})}})}})},
  });
  cf::Dictionary internal = Options({
      {"ScalarKeyPrefixes", Options({{"com.velmora.debug.", cf::Dictionary()}})},
  });
  return Options({
      {"Homedeck", Options({{"ScalarKeys", homedeck_scalars}, {"DistributionKeys", homedeck_dists}})},
      {"Power", Options({{"ScalarKeys", power_scalars}, {"DistributionKeys", power_dists}})},
      {"Network", network},
      {"InternalTesting", internal},
  });
}

bool WritePlist(const std::string& path, const cf::Value& value, std::string* error) {
  std::string bytes;
  return cf::WriteXMLPropertyList(value, bytes, error) && platform::WriteFileAtomically(path, bytes, error);
}

// A small repeatable generator, so every root starts from the same numbers.
struct Random {
  uint64_t state;
  double Next() {
    state ^= state << 13, state ^= state >> 7, state ^= state << 17;
    return static_cast<double>(state % 1000000) / 1000000.0;
  }
};

bool FillDay(platform::TallyStore& store, int32_t day, double fraction_of_day) {
  Random r{0x9e3779b97f4a7c15ULL ^ static_cast<uint64_t>(day)};
  auto scale = [&](double full) { return static_cast<int64_t>(std::llround(full * fraction_of_day)); };
  // Roughly log-normal around the median, as latencies and rates are.
  auto samples = [&](int n, double median, double spread) {
    std::vector<std::pair<double, int32_t>> out;
    const int count = std::max(1, static_cast<int>(n * fraction_of_day));
    for (int i = 0; i < count; ++i) {
      const int32_t offset = static_cast<int32_t>(86400.0 * fraction_of_day * i / count);
      const double v = median * std::exp(spread * (r.Next() + r.Next() + r.Next() - 1.5));
      out.emplace_back(std::round(v * 100) / 100, offset);
    }
    return out;
  };
  return store.Batch([&] {
    return store.SetScalar(day, "com.velmora.homedeck.Unlocks", scale(87 + 20 * r.Next())) &&
           store.SetScalar(day, "com.velmora.homedeck.AppLaunches", scale(214 + 40 * r.Next())) &&
           store.SetScalar(day, "com.velmora.homedeck.ScreenOnSeconds", scale(15321 + 3000 * r.Next())) &&
           store.SetScalar(day, "com.velmora.power.ChargeCycles", 412) &&
           store.SetScalar(day, "com.velmora.power.EnergyUsedmWh", scale(9876 + 500 * r.Next())) &&
           store.SetScalar(day, "com.velmora.wifi.JoinFailures", scale(3 * r.Next())) &&
           store.SetScalar(day, "com.velmora.wifi.Roams", scale(12 + 6 * r.Next())) &&
           store.SetScalar(day, "com.velmora.debug.Asserts", scale(2)) &&
           store.SetScalar(day, "com.velmora.camera.PhotosTaken", scale(23)) &&
           store.PushSamples(day, "com.velmora.homedeck.AppLaunchTimeMs", samples(214, 320, 1.2)) &&
           store.PushSamples(day, "com.velmora.power.BatteryTemperatureC", samples(288, 29, 0.5)) &&
           store.PushSamples(day, "com.velmora.net.DNSLatencyMs", samples(500, 45, 2.0)) &&
           store.PushSamples(day, "com.velmora.net.ThroughputKbps", samples(120, 18000, 1.5)) &&
           store.PushSamples(day, "com.velmora.audio.VolumeLevel", samples(40, 0.5, 0.8));
  });
}

}  // namespace

bool WriteDefaultRoot(const std::string& root, std::string* error) {
  platform::ContextScope scope(root);
  platform::Context& c = scope.context();
  if (!WritePlist(c.Path("/Library/Application Support/Tallybook/Whitelist_boxOS.plist"), Whitelist(), error))
    return false;
  cf::Dictionary answers;
  answers.Set("DiagnosticLogSubmissionEnabled", cf::Value::Bool(true));
  answers.Set("InternalBuild", cf::Value::Bool(false));
  if (!WritePlist(c.Path("/device/answers.plist"), answers, error)) return false;
  cf::Dictionary version;
  version.Set("ProductName", "boxOS");
  version.Set("ProductVersion", "4.2");
  version.Set("ProductBuildVersion", "22C41");
  if (!WritePlist(c.Path("/device/system-version.plist"), version, error)) return false;

  // A fresh store: yesterday in full, today up to the clock's time of day.
  const std::string store_path = c.Path(platform::kStoreDevicePath);
  for (const char* suffix : {"", "-wal", "-shm"}) unlink((store_path + suffix).c_str());
  auto store = platform::TallyStore::Open(store_path, platform::TallyStore::Mode::kCreate, error);
  if (!store) return false;
  const int32_t today = TBDaysSince1970();
  const double fraction = std::clamp((platform::Now() - platform::StartOfDay(today)) / 86400.0, 0.05, 1.0);
  if (!FillDay(*store, today - 1, 1.0) || !FillDay(*store, today, fraction) || !store->Checkpoint()) {
    if (error) *error = store->last_error();
    return false;
  }
  return true;
}
