#include "tools/default_root.h"

#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <vector>

#include "cf/plist.h"
#include "nandinfo/view_tables.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/device_root.h"
#include "platform/faultkeep.h"
#include "platform/files.h"
#include "platform/host_disk.h"
#include "platform/store.h"
#include "platform/usage.h"
#include "sim/default_device.h"

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

constexpr const char* kMetricKeys[] = {
    "com.velmora.homedeck.numAllInstalledApps",
    "com.velmora.homedeck.numThirdPartyApps",
    "com.velmora.diagvault.tbkd.database.size",
    "com.velmora.diagvault.tbkd.database.corruptions",
    "com.velmora.usage.cur_boot_session_cpu_uptime",
    "com.velmora.kernel.memorystatus_freeze_count",
    "com.velmora.kernel.memorystatus_freeze_pageouts",
    "com.velmora.memorystatus_freezer_thaws_per_gb",
    "com.velmora.kernel.memorystatus_freeze_budget_pages_remaining",
    "com.velmora.kernel.memorystatus_thaw_count",
    "com.velmora.kernel.swapusage",
    "com.velmora.memorystatus_freezer_error_no_compressor_space_count",
    "com.velmora.memorystatus_freezer_error_no_swap_space_count",
    "com.velmora.memorystatus_freezer_error_below_min_pages_count",
    "com.velmora.memorystatus_freezer_error_low_probability_of_use_count",
    "com.velmora.memorystatus_freezer_error_other_count",
    "com.velmora.memorystatus_freezer_process_considered_count",
    "com.velmora.memorystatus_freezer_skipped_full_count",
    "com.velmora.memorystatus_freezer_thaw_percentage",
    "com.velmora.memorystatus_freezer_refreeze_average",
};

// A plausible kernel: about 2 GiB frozen since boot, a few hundred freezer
// decisions, a dozen refreezes.
cf::Dictionary SysctlProfile() {
  const std::pair<const char*, int64_t> values[] = {
      {"kern.memorystatus_freeze_count", 37},
      {"kern.memorystatus_freeze_pageouts", 524288},
      {"kern.memorystatus_thaw_count_since_boot", 123},
      {"kern.memorystatus_freeze_budget_pages_remaining", 1048576},
      {"kern.memorystatus_thaw_count", 95},
      {"kern.memorystatus_freezer_process_considered_count", 400},
      {"kern.memorystatus_freezer_error_no_compressor_space_count", 4},
      {"kern.memorystatus_freezer_error_no_swap_space_count", 2},
      {"kern.memorystatus_freezer_error_below_min_pages_count", 60},
      {"kern.memorystatus_freezer_error_low_probability_of_use_count", 30},
      {"kern.memorystatus_freezer_error_other_count", 1},
      {"kern.memorystatus_freezer_below_threshold_count", 50},
      {"kern.memorystatus_freezer_skipped_full_count", 5},
      {"kern.memorystatus_freezer_thaw_percentage", 23},
      {"kern.memorystatus_freezer_refreeze_count", 12},
      {"kern.memorystatus_freezer_bytes_refrozen", 98304000},
  };
  cf::Dictionary d;
  for (const auto& [name, value] : values) d.Set(name, cf::Value::SInt64(value));
  return d;
}

// The analytics events in use: the app installs, the storage views and the
// reference map's group events.
cf::Array EnabledEvents() {
  cf::Array events({cf::Value("com.velmora.homedeck.appInstalls")});
  for (const nandinfo::EventFields& e : nandinfo::EventLensConfigDetails()) events.Append(cf::Value(e.event));
  for (std::string_view group : nandinfo::EventLensEvents()) events.Append(cf::Value(group));
  return events;
}

cf::Array Apps() {
  const std::pair<const char*, const char*> apps[] = {
      {"com.velmora.homedeck", "System"},   {"com.velmora.camera", "System"},   {"com.velmora.settings", "System"},
      {"com.velmora.mail", "System"},       {"com.example.notes", "User"},      {"com.example.maps", "User"},
      {"com.example.podcasts", "User"},
  };
  cf::Array out;
  for (const auto& [id, type] : apps) {
    cf::Dictionary app;
    app.Set("bundleIdentifier", id);
    app.Set("bundleType", type);
    out.Append(app);
  }
  return out;
}

// The usage service's counters: an app whose counters began today and one
// whose began yesterday (both written whole by the first run), and a daemon
// counting since days before (old data).
cf::Dictionary Usage(int32_t today) {
  struct Entry {
    const char* bundle;
    const char* proc;
    int32_t since_day;
    int64_t bytes[4];
  };
  const Entry entries[] = {
      {"com.example.maps", "Maps", today, {52428800, 2097152, 10485760, 524288}},
      {"com.example.podcasts", "Podcasts", today - 1, {734003200, 1048576, 0, 0}},
      {nullptr, "netsyncd", today - 5, {8388608, 4194304, 1048576, 65536}},
  };
  cf::Array records;
  for (const Entry& e : entries) {
    cf::Dictionary r;
    if (e.bundle) r.Set("bundleName", e.bundle);
    r.Set("procName", e.proc);
    r.Set(kUsageSinceTime, cf::Date{platform::StartOfDay(e.since_day) + 1800});
    const char* fields[] = {"wifiInBytes", "wifiOutBytes", "wwanInBytes", "wwanOutBytes"};
    for (int i = 0; i < 4; ++i) r.Set(fields[i], cf::Value::SInt64(e.bytes[i]));
    records.Append(r);
  }
  cf::Dictionary usage;
  usage.Set("records", records);
  return usage;
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
  // Every report-side metric the report can add.
  cf::Dictionary system_scalars;
  for (const char* key : kMetricKeys) system_scalars.Set(key, cf::Dictionary());
  cf::Dictionary internal = Options({
      {"ScalarKeyPrefixes", Options({{"com.velmora.debug.", cf::Dictionary()}})},
  });
  return Options({
      {"Homedeck", Options({{"ScalarKeys", homedeck_scalars}, {"DistributionKeys", homedeck_dists}})},
      {"Power", Options({{"ScalarKeys", power_scalars}, {"DistributionKeys", power_dists}})},
      {"Network", network},
      {"System", Options({{"ScalarKeys", system_scalars}})},
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

// The whitelist, the answers (with a made-up hardware model unless the
// machine's own is wanted) and the enabled analytics events.
bool WriteCommonFiles(platform::Context& c, bool host, std::string* error) {
  if (!WritePlist(c.Path("/Library/Application Support/Tallybook/Whitelist_boxOS.plist"), Whitelist(), error))
    return false;
  cf::Dictionary answers;
  answers.Set("DiagnosticLogSubmissionEnabled", cf::Value::Bool(true));
  answers.Set("InternalBuild", cf::Value::Bool(false));
  if (!host) answers.Set("HardwareModel", "BX12,3");
  answers.Set("InverseDeviceID", "5d0c4e1a9b7f42e8a3c61f0b8e2d7a94");
  answers.Set("SystemLanguages", cf::Array({cf::Value("en"), cf::Value("de"), cf::Value("fr"), cf::Value("ja")}));
  return WritePlist(c.Path("/device/answers.plist"), answers, error) &&
         WritePlist(c.Path("/var/eventlens/enabled-events.plist"), EnabledEvents(), error);
}

// The support library and a fresh store: yesterday in full, today up to the
// clock's time of day.
bool WriteLibraryAndStore(platform::Context& c, const std::string& support_library, std::string* error) {
  const auto library = platform::ReadFile(support_library, error);
  if (!library || !platform::WriteFileAtomically(c.Path(kFaultkeepSupportPath), *library, error, 0755)) return false;
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

cf::Dictionary Entry(std::initializer_list<std::pair<const char*, cf::Value>> entries) {
  return cf::Dictionary::Of(entries);
}

}  // namespace

bool WriteHostRoot(const std::string& root, const std::string& support_library, std::vector<std::string>* disks,
                   std::string* error) {
  platform::ContextScope scope(root);
  platform::Context& c = scope.context();
  if (!platform::WriteRootMarker(root, error) || !WriteCommonFiles(c, true, error)) return false;
  // Any files of an earlier default root there would put simulated parts
  // back beside the disks.
  for (const char* name : {"controller.plist", "stackshot.plist", "purgeable.plist", "ecc-events.plist",
                           "ioreport.plist", "sysctl.plist", "system-version.plist", "apps.plist", "usage.plist"})
    unlink(c.Path(std::string("/device/") + name).c_str());
  *disks = platform::ListHostDisks(root);
  constexpr uint64_t kPlatformId = 0x100000100;
  cf::Array registry({Entry({{"class", "IOPlatformExpertDevice"}, {"name", "device-tree"},
                             {"id", cf::Value::UInt64(kPlatformId)}})});
  for (size_t i = 0; i < disks->size(); ++i) {
    const std::string& device = (*disks)[i];
    registry.Append(Entry({{"class", "VelmoraEmbeddedNVMeController"},
                           {"name", device.substr(device.rfind('/') + 1)},
                           {"id", cf::Value::UInt64(kPlatformId + 0x900 + i)},
                           {"parent", cf::Value::UInt64(kPlatformId)},
                           {"userClient", "host"},
                           {"properties", Entry({{"device", device}})}}));
  }
  return WritePlist(c.Path("/device/registry.plist"), registry, error) &&
         WriteLibraryAndStore(c, support_library, error);
}

bool WriteDefaultRoot(const std::string& root, const std::string& support_library, std::string* error) {
  platform::ContextScope scope(root);
  platform::Context& c = scope.context();
  if (!platform::WriteRootMarker(root, error) || !WriteCommonFiles(c, false, error)) return false;
  cf::Dictionary version;
  version.Set("ProductName", "boxOS");
  version.Set("ProductVersion", "4.2");
  version.Set("ProductBuildVersion", "22C41");
  if (!WritePlist(c.Path("/device/system-version.plist"), version, error)) return false;
  const sim::DefaultDevice device = sim::DefaultStorageDevice();
  cf::Dictionary sysctl = SysctlProfile();
  sysctl.Set("kern.bootsessionuuid", device.boot_session_uuid);
  if (!WritePlist(c.Path("/device/sysctl.plist"), sysctl, error) ||
      !WritePlist(c.Path("/device/registry.plist"), device.registry, error) ||
      !WritePlist(c.Path("/device/controller.plist"), device.controller, error) ||
      !WritePlist(c.Path("/device/stackshot.plist"), device.stackshot, error) ||
      !WritePlist(c.Path("/device/purgeable.plist"), device.purgeable, error) ||
      !WritePlist(c.Path("/device/ecc-events.plist"), device.ecc_events, error) ||
      !WritePlist(c.Path("/device/ioreport.plist"), device.ioreport, error) ||
      !WritePlist(c.Path("/device/ean.plist"), device.ean, error))
    return false;
  if (!WritePlist(c.Path("/device/apps.plist"), Apps(), error)) return false;
  if (!WritePlist(c.Path(kUsageDevicePath), Usage(TBDaysSince1970()), error)) return false;
  return WriteLibraryAndStore(c, support_library, error);
}
