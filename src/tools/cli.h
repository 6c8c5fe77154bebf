// Command-line parsing and the device-root check shared by the tools: bad
// usage exits 2, an unusable root 1.
#pragma once

#include <CLI/CLI.hpp>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <optional>
#include <string>

#include "platform/context.h"

#include "platform/files.h"

// Nothing when the program should go on; otherwise its exit status (0 after
// --help, 2 for a usage error, which CLI11 has already explained).
// Every tool creates what it creates under the root privately.
inline std::optional<int> ParseCommandLine(CLI::App& app, int argc, char** argv) {
  platform::ApplyPrivateUmask();
  try {
    app.parse(argc, argv);
  } catch (const CLI::CallForHelp& e) {
    return app.exit(e);
  } catch (const CLI::ParseError& e) {
    app.exit(e);
    return 2;
  }
  return std::nullopt;
}

// The device root (TALLYRUN_ROOT) must be a directory this user can read: a
// mistyped root is an error, never a reason to make a new one, and a root we
// cannot read is not one to write into. Nothing when it is fine; otherwise
// the exit status, after a message.
inline std::optional<int> CheckDeviceRoot(const char* tool) {
  const std::string& root = platform::Context::Current().root();
  auto fail = [&](const std::string& message) {
    std::fprintf(stderr, "%s: %s\n", tool, message.c_str());
    return std::optional<int>(1);
  };
  struct stat st;
  if (stat(root.c_str(), &st) != 0) {
    const int cause = errno;
    if (cause == ENOENT)
      return fail("no device root at " + root + " (TALLYRUN_ROOT); make one with: devsim init " + root);
    return fail("cannot use the device root " + root + ": " + std::strerror(cause));
  }
  if (!S_ISDIR(st.st_mode)) return fail("the device root " + root + " is not a directory");
  // A root that grants no one reading is locked on purpose, even against
  // the superuser, who would otherwise fill it with files of its own.
  if ((st.st_mode & (S_IRUSR | S_IRGRP | S_IROTH)) == 0)
    return fail("cannot read the device root " + root + ": " + std::strerror(EACCES));
  if (access(root.c_str(), R_OK | X_OK) != 0) {
    const int cause = errno;
    return fail("cannot read the device root " + root + ": " + std::strerror(cause));
  }
  return std::nullopt;
}
