// The usage service: per-process network byte counters, answered from
// $ROOT/device/usage.plist:
//
//   {"records": [{"bundleName"?, "procName", "sinceTime" (a date),
//                 "wifiInBytes", "wifiOutBytes", "wwanInBytes", "wwanOutBytes"}],
//    "delaySeconds": 0 to 3600 (default 0), "neverReply": false}
//
// The file is read when the request is sent. The reply comes on a thread of
// the client's own, never on the caller's, after delaySeconds. No file: an
// immediate empty reply. "neverReply" true: no reply at all. A file that
// cannot be read or does not have this shape gets one error line and no
// reply: to the caller that is a service with nothing to say, and an empty
// reply would read as "no process used the network" and wipe what the caller
// keeps from earlier replies. The records themselves are passed on as they
// are, however malformed; the caller checks each.
//
// A reply that is running when the process exits is allowed to finish
// (exit waits for it); a reply not yet started by then is dropped, so a
// service that never answers does not hold the process.
#pragma once

#include <functional>
#include <memory>
#include <set>
#include <string>

#include "cf/value.h"

inline constexpr const char* kVitalisAnalyticsServiceEndpoint = "com.velmora.vitalis.analytics";
// The start date of a usage record's counters.
inline constexpr const char* kUsageSinceTime = "sinceTime";

// How the names of a request are matched.
enum UsageNameKind { kUsageProcessProcName = 0 };

inline constexpr const char* kUsageDevicePath = "/device/usage.plist";

class AnalyticsWorkspace {
 public:
  // initWorkspaceWithService:
  explicit AnalyticsWorkspace(std::string service) : service_(std::move(service)) {}
  const std::string& service() const { return service_; }

 private:
  std::string service_;
};

class UsageFeed {
 public:
  // initWithWorkspace:
  explicit UsageFeed(std::shared_ptr<AnalyticsWorkspace> workspace) : workspace_(std::move(workspace)) {}

  using Reply = std::function<void(const cf::Array& records)>;
  // usageToDateFor:nameKind:reply: the records of the processes named (all
  // of them for an empty set), to reply on the client's thread. The reply
  // owns the records it is given.
  void UsageToDateFor(const std::set<std::string>& names, UsageNameKind kind, Reply reply);

 private:
  std::shared_ptr<AnalyticsWorkspace> workspace_;
};
