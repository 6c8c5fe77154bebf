// Command-line parsing shared by the tools: bad usage exits 2.
#pragma once

#include <CLI/CLI.hpp>

#include <optional>

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
