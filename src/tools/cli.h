// Command-line parsing and the device-root check shared by the tools: bad
// usage exits 2, an unusable root 1.
#pragma once

#include <CLI/CLI.hpp>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <optional>
#include <string>
#include <vector>

#include "platform/clock.h"
#include "platform/context.h"
#include "platform/device_root.h"
#include "platform/files.h"

// The program's name as a person typed it, for its messages.
inline const char* ProgramName(const char* argv0) {
  const char* slash = std::strrchr(argv0, '/');
  return slash ? slash + 1 : argv0;
}

// Nothing when the program should go on; otherwise its exit status (0 after
// --help, 2 for a usage error, which CLI11 has already explained).
// Every tool creates what it creates under the root privately.
inline std::optional<int> ParseCommandLine(CLI::App& app, int argc, char** argv) {
  platform::ApplyPrivateUmask();
  // A first word that names no subcommand is named back, with the valid
  // ones (the parser would only say that one is required).
  if (argc > 1 && argv[1][0] != '-' && !app.get_subcommands({}).empty()) {
    std::string valid;
    bool known = false;
    for (const CLI::App* sub : app.get_subcommands({})) {
      known = known || sub->get_name() == argv[1];
      valid += (valid.empty() ? "" : ", ") + sub->get_name();
    }
    if (!known) {
      std::fprintf(stderr, "%s: unknown subcommand '%s'; the subcommands are: %s (--help for more)\n",
                   ProgramName(argv[0]), argv[1], valid.c_str());
      return 2;
    }
  }
  try {
    app.parse(argc, argv);
  } catch (const CLI::CallForHelp& e) {
    return app.exit(e);
  } catch (const CLI::ParseError& e) {
    app.exit(e);
    return 2;
  }
  // The parser reads empty text as 0 for a number: an empty --day, --offset
  // or operation would act on day 0 or now.
  std::vector<const CLI::App*> apps{&app};
  for (size_t i = 0; i < apps.size(); ++i)
    for (const CLI::App* sub : apps[i]->get_subcommands({})) apps.push_back(sub);
  for (const CLI::App* a : apps)
    for (const CLI::Option* o : a->get_options()) {
      const std::string type = o->get_type_name();
      const bool number = type == "INT" || type == "UINT" || type == "FLOAT" || type == "NUMBER";
      for (const std::string& r : o->results())
        if ((number || o->get_name() == "--day") && r.empty()) {
          std::fprintf(stderr, "%s: %s needs a value, not empty text\n", ProgramName(argv[0]),
                       o->get_name().c_str());
          return 2;
        }
    }
  // A mistyped moment would put what the tool reads or writes on the wrong day.
  if (const auto clock_error = platform::ClockOverrideError()) {
    std::fprintf(stderr, "%s: %s\n", ProgramName(argv[0]), clock_error->c_str());
    return 2;
  }
  return std::nullopt;
}

// The device root (TALLYRUN_ROOT) must be a root `devsim init` made, that
// this user can read: a mistyped root is an error, never a reason to make a
// new one or to write into some other directory. Nothing when it is fine;
// otherwise the exit status, after a message.
inline std::optional<int> CheckDeviceRoot(const char* tool) {
  const platform::RootCheck check = platform::CheckDeviceRoot(platform::Context::Current().root());
  if (check.ok()) return std::nullopt;
  std::fprintf(stderr, "%s: %s\n", tool, check.message.c_str());
  return 1;
}

// A day as the tools take it: a day number (whole local days since
// 1970-01-01) or an ISO date (YYYY-MM-DD). Nothing, with the reason in
// *error, for anything else.
inline std::optional<int64_t> ParseDay(const std::string& text, std::string* error) {
  int64_t day = 0;
  const char* end = text.data() + text.size();
  if (auto [ptr, ec] = std::from_chars(text.data(), end, day); ec == std::errc() && ptr == end && !text.empty())
    return day;
  int year = 0;
  unsigned month = 0, mday = 0;
  char tail = 0;
  if (text.size() == 10 && text[4] == '-' && text[7] == '-' &&
      std::sscanf(text.c_str(), "%4d-%2u-%2u%c", &year, &month, &mday, &tail) == 3 && month >= 1 && month <= 12 &&
      mday >= 1) {
    const int64_t first = platform::DaysFromCivil(year, month, 1);
    const int64_t next = month == 12 ? platform::DaysFromCivil(year + 1, 1, 1) : platform::DaysFromCivil(year, month + 1, 1);
    if (mday <= next - first) return first + mday - 1;
  }
  *error = "expected a day number or an ISO date (YYYY-MM-DD), not '" + text +
           "'; `tallybook today` prints today's day number";
  return std::nullopt;
}
