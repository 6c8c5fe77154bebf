// The usage service's answer as usage.plist gives it, through the service
// (which reads the file from a scratch device root) and the daily job's
// handler of its reply (which turns the records into kilobyte keys and
// keeps them as a baseline). Two keys of the input are the target's own,
// which the service passes over: "baseline", stored as the baseline of an
// earlier run before the request, and "names", the process names to ask
// for (all processes when absent).
//
// A reply must come exactly when the file has the service's shape, holding
// only the records asked for. The baseline the handler leaves is one it
// can read back: at most an entry per record, each a start date and four
// counters.
//
// A positive "delaySeconds" would hold a reply back for up to an hour, so
// such files skip the service and go to the handler directly.
#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <semaphore>
#include <set>
#include <string>
#include <string_view>
#include <unistd.h>

#include "cf/plist.h"
#include "collect/datausage.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/device_root.h"
#include "platform/log.h"
#include "platform/prefs.h"
#include "platform/usage.h"
#include "scratch_root.h"

namespace {


std::string g_root;
std::unique_ptr<UsageFeed> g_feed;
// Replies that came for a file that should have had none. They arrive on
// the service's thread, so the input after the one at fault may notice.
std::atomic<int> g_unexpected_replies{0};


struct Request {
  std::counting_semaphore<> done{0};
  bool expected = false;
  std::set<std::string> names;
  size_t delivered = 0;
  bool only_named = true;
};

// Whether the service answers this file at all, by the shape it documents.
bool Answers(const cf::Dictionary* file, double* delay) {
  *delay = 0;
  if (!file) return false;
  const cf::Value& records = file->Get("records");
  if (!records.IsNull() && !records.AsArray()) return false;
  const cf::Value& seconds = file->Get("delaySeconds");
  if (!seconds.IsNull()) {
    const double d = seconds.AsNumber() ? seconds.AsNumber()->AsFloat64() : -1;
    if (!(d >= 0 && d <= 3600)) return false;
    *delay = d;
  }
  const cf::Value& never = file->Get("neverReply");
  if (!never.IsNull() && !never.AsBool()) return false;
  return !(never.AsBool() && *never.AsBool());
}

// The baseline left behind: a dictionary of at most one entry per record,
// each [start date, four counters] under a non-empty name.
void CheckBaseline(size_t records) {
  const cf::Value kept = DGVPreferencesGetValue(kDataUsageBaselineKey, kDataUsageBaselineDomain);
  const cf::Dictionary* baseline = kept.AsDictionary();
  if (!baseline || baseline->size() > records) __builtin_trap();
  for (const auto& [name, entry] : *baseline) {
    const cf::Array* e = entry.AsArray();
    if (name.StringView().empty() || !e || e->size() != 5 || !e->at(0).AsDate()) __builtin_trap();
    for (size_t i = 1; i < 5; ++i)
      if (!e->at(i).AsNumber()) __builtin_trap();
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  // In memory where it can be (the handler syncs the preferences file on
  // every reply), for the whole run, so the store and preferences stay open.
  g_root = fuzz::ScratchRoot("usage");
  std::filesystem::create_directories(g_root + "/device");
  g_feed = std::make_unique<UsageFeed>(std::make_shared<AnalyticsWorkspace>(kVitalisAnalyticsServiceEndpoint));
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (g_unexpected_replies.load() != 0) __builtin_trap();  // an earlier file was answered when it should not be
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  const cf::ParseResult parsed = cf::ParsePropertyList(bytes);
  const cf::Dictionary* file = parsed.ok() ? parsed.value.AsDictionary() : nullptr;

  // Each input starts from its own baseline, or none.
  DGVPreferencesSetValue(kDataUsageBaselineKey, cf::Value(), kDataUsageBaselineDomain);
  if (file && !file->Get("baseline").IsNull())
    DGVPreferencesSetValue(kDataUsageBaselineKey, file->Get("baseline"), kDataUsageBaselineDomain);

  auto request = std::make_shared<Request>();
  if (file)
    if (const cf::Array* names = file->Get("names").AsArray())
      for (const cf::Value& name : *names)
        if (name.AsString()) request->names.insert(std::string(name.StringView()));

  double delay = 0;
  request->expected = Answers(file, &delay);
  if (delay > 0) {
    const cf::Array* records = file->Get("records").AsArray();
    const cf::Array none;
    std::counting_semaphore<> done(0);
    ProcessDataUsageReply(records ? *records : none, done);
    if (!done.try_acquire()) __builtin_trap();  // the handler signals as its last act
    CheckBaseline(records ? records->size() : 0);
    return 0;
  }

  {
    std::ofstream out(g_root + kUsageDevicePath, std::ios::binary | std::ios::trunc);
    out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
  }
  g_feed->UsageToDateFor(request->names, kUsageProcessProcName, [request](const cf::Array& records) {
    if (!request->expected) ++g_unexpected_replies;
    request->delivered = records.size();
    if (!request->names.empty())
      for (const cf::Value& record : records) {
        const cf::Dictionary* r = record.AsDictionary();
        const cf::String* name = r ? r->Get("procName").AsString() : nullptr;
        if (!name || !request->names.count(std::string(name->view()))) request->only_named = false;
      }
    ProcessDataUsageReply(records, request->done);
  });
  if (!request->expected) return 0;
  if (!request->done.try_acquire_for(std::chrono::seconds(30))) __builtin_trap();  // no reply came
  const cf::Array* records = file->Get("records").AsArray();
  if (!request->only_named || request->delivered > (records ? records->size() : 0)) __builtin_trap();
  CheckBaseline(request->delivered);
  return 0;
}
