// A private device root for the targets whose code reads or writes files:
// made once per fuzzing process, in memory where it can be, marked as a
// root, removed at exit. The clock is fixed and the log goes nowhere.
#pragma once

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <memory>
#include <string>

#include "platform/clock.h"
#include "platform/context.h"
#include "platform/device_root.h"
#include "platform/log.h"

namespace fuzz {

class NullLog : public platform::LogSink {
 public:
  void Write(platform::LogLevel, std::string_view) override {}
};

// 2025-06-15 15:06:40 UTC; seeds date their records from it.
inline constexpr double kScratchNow = 1.75e9;

// The root's path; the first call makes it and enters it for the process.
inline const std::string& ScratchRoot(const char* name) {
  static std::string root;
  static std::unique_ptr<platform::ContextScope> scope;
  if (!root.empty()) return root;
  std::error_code ec;
  const std::string parent = std::filesystem::is_directory("/dev/shm", ec) && access("/dev/shm", W_OK) == 0
                                 ? "/dev/shm"
                                 : std::filesystem::temp_directory_path().string();
  std::string tmpl = parent + "/fuzz-" + name + "-XXXXXX";
  if (!mkdtemp(tmpl.data())) std::abort();
  root = tmpl;
  std::atexit([] {
    std::error_code ignored;
    std::filesystem::remove_all(root, ignored);
  });
  if (!platform::WriteRootMarker(root, nullptr)) std::abort();
  scope = std::make_unique<platform::ContextScope>(
      root, platform::Backends{std::make_shared<platform::FixedClock>(kScratchNow), std::make_shared<NullLog>()});
  return root;
}

}  // namespace fuzz
