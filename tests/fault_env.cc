// Fault injection for test builds of the job: linked only into test
// programs, never into the product, so only they read TALLYRUN_FAULT.
//   TALLYRUN_FAULT=crash:N   the process is killed at fault point N
//   TALLYRUN_FAULT=ENOSPC:N  point N fails with ENOSPC (also EIO)
// At a normal exit the program reports how many points it passed, so a test
// can walk every one of them.
#include <errno.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "platform/files.h"

namespace {

struct Installer {
  Installer() {
    const char* spec = std::getenv("TALLYRUN_FAULT");
    if (!spec || !*spec) return;
    const std::string text = spec;
    const size_t colon = text.find(':');
    platform::testing::FaultPlan plan;
    const std::string kind = text.substr(0, colon == std::string::npos ? 0 : colon);
    plan.at = colon == std::string::npos ? 0 : std::strtoull(text.c_str() + colon + 1, nullptr, 10);
    if (kind == "crash") plan.kind = platform::testing::FaultPlan::Kind::kCrash;
    else if (kind == "ENOSPC" || kind == "EIO") {
      plan.kind = platform::testing::FaultPlan::Kind::kFail;
      plan.error = kind == "EIO" ? EIO : ENOSPC;
    } else if (kind != "count") {
      std::fprintf(stderr, "TALLYRUN_FAULT: expected crash:N, ENOSPC:N, EIO:N or count:0, not %s\n", spec);
      std::_Exit(2);
    }
    platform::testing::SetFaultPlan(plan);
    std::atexit([] {
      std::fprintf(stderr, "fault points passed: %llu\n",
                   static_cast<unsigned long long>(platform::testing::FaultPointsPassed()));
    });
  }
} installer;

}  // namespace
