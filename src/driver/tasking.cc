// Tasking: applying or withdrawing the remote tasking payload, and
// recording OS changes between runs.
#include <algorithm>
#include <string>
#include <vector>

#include "cf/plist.h"
#include "driver/driver.h"
#include "platform/diagnostics.h"
#include "platform/log.h"
#include "platform/prefs.h"
#include "platform/services.h"
#include "platform/store.h"
#include "platform/system.h"
#include "report/report.h"

using platform::LogDefault;
using platform::LogError;

namespace {

constexpr const char* kTaskingChanged = "com.velmora.da.tasking_changed";

// Domains to synchronize once each at the end, in the order first touched.
class DomainSet {
 public:
  void Add(const std::string& d) {
    if (std::find(domains_.begin(), domains_.end(), d) == domains_.end()) domains_.push_back(d);
  }
  const std::vector<std::string>& domains() const { return domains_; }

 private:
  std::vector<std::string> domains_;
};

enum class Action { kApply, kRemove };

// Writes or removes one payload entry, by its user.
void Process(const cf::Value& entry, Action action, DomainSet& touched) {
  // Only string keys and domains can name a preference; anything else would
  // be stored as pending and keep its whole domain from being written.
  const cf::Dictionary* e = entry.AsDictionary();
  const cf::Value key = e ? e->Get("Key") : cf::Value();
  const cf::String* domain = e ? e->Get("Domain").AsString() : nullptr;
  if (!key.AsString() || !domain) {
    LogError("Skipping a tasking entry without a string Key or Domain: %@", entry);
    return;
  }
  const cf::String* user_value = e->Get("User").AsString();
  const std::string user = user_value ? *user_value : std::string();
  const cf::Value value = action == Action::kApply ? e->Get("Value") : cf::Value();
  if (user == "mobile") {
    DGVPreferencesSetValue(key, value, *domain);
    touched.Add(*domain);
  } else if (user == "__diagvault__") {
    DGVSystemConfiguration::sharedInstance().setPrefsKey(key, value, *domain, action == Action::kApply);
  } else if (action == Action::kApply) {
    DGVServicesClient::sharedClient().setPreference(key, user, *domain, value);
  } else {
    DGVServicesClient::sharedClient().deletePreference(key, user, *domain);
  }
}

void ProcessAll(const cf::Value& payload, Action action, DomainSet& touched) {
  if (const cf::Array* entries = payload.AsArray())
    for (const cf::Value& entry : *entries) Process(entry, action, touched);
}

// The entries of a new payload that can be applied and kept: one that no
// preference file could hold is skipped here, so that the payload stored
// for a later withdrawal is complete and holds only what was applied.
cf::Value UsableEntries(const cf::Value& payload) {
  const cf::Array* entries = payload.AsArray();
  if (!entries) return payload;
  cf::Array usable;
  for (const cf::Value& entry : *entries) {
    std::string scratch, why;
    if (entry.AsDictionary() && !cf::WriteXMLPropertyList(entry, scratch, &why)) {
      LogError("Skipping a tasking entry that no preference file can hold: %s", why);
      continue;
    }
    usable.Append(entry);
  }
  return usable;
}

}  // namespace

void UpdateTasking() {
  // 1. OS change.
  const int32_t today = TBDaysSince1970();
  const cf::Value system_version = _CFCopySystemVersionDictionary();
  const cf::Value build = system_version.AsDictionary()
                              ? system_version.AsDictionary()->Get("ProductBuildVersion")
                              : cf::Value();
  if (!build.IsNull()) {
    const cf::Value last = DGVPreferencesGetValue("LastOSUpdate", kTallyrunDomain);
    const cf::Value last_version = last.AsDictionary() ? last.AsDictionary()->Get("version") : cf::Value();
    if (last_version != build) {
      LogDefault("OS change since last run (%{public}@ -> %{public}@)", last_version, build);
      cf::Dictionary record;
      record.Set("version", build);
      record.Set("day", cf::Value::SInt32(today));
      DGVPreferencesSetValue("LastOSUpdate", record, kTallyrunDomain);
    }
  }

  // 2. The scheduled tasking.
  const cf::Value scheduled =
      DGVSystemConfiguration::sharedInstance().getPrefsKey("ScheduledTasking", kScheduledTaskingDomain, cf::Value());
  const cf::Dictionary* s = scheduled.AsDictionary();
  if (!s) return;
  const cf::Value new_id = s->Get("TaskingID");
  if (new_id.IsNull()) return;

  // 3, 4. Compare with what was applied, and withdraw it when it differs.
  const cf::Value old_id = DGVPreferencesGetValue("TaskingID", kTallyrunDomain);
  const cf::Value old_os = DGVPreferencesGetValue("TaskingOS", kTallyrunDomain);
  DomainSet touched;
  if (!old_id.IsNull()) {
    if (old_id == new_id && old_os == build) return;
    LogDefault("Tasking update (%{public}@ -> %{public}@, %{public}@ -> %{public}@)", old_id, new_id, old_os, build);
    const cf::Value old_payload = DGVPreferencesGetValue("TaskingPayload", kTallyrunDomain);
    if (!old_payload.IsNull()) {
      ProcessAll(old_payload, Action::kRemove, touched);
      for (const char* k : {"TaskingID", "TaskingDigest", "TaskingPayload"})
        DGVPreferencesSetValue(k, cf::Value(), kTallyrunDomain);
      touched.Add(kTallyrunDomain);
    }
  }

  // 5. Apply the new payload.
  const cf::Value payload = UsableEntries(s->Get("TaskingPayload"));
  if (!payload.IsNull()) {
    ProcessAll(payload, Action::kApply, touched);
    DGVPreferencesSetValue("TaskingID", new_id, kTallyrunDomain);
    DGVPreferencesSetValue("TaskingOS", build, kTallyrunDomain);
    DGVPreferencesSetValue("TaskingDigest", s->Get("TaskingDigest"), kTallyrunDomain);
    DGVPreferencesSetValue("TaskingPayload", payload, kTallyrunDomain);
    touched.Add(kTallyrunDomain);
  }

  // 6, 7. Synchronize each touched domain once, then tell the others.
  for (const std::string& domain : touched.domains()) DGVPreferencesSynchronize(domain);
  notify_post(kTaskingChanged);
}
