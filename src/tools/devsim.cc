// devsim: the simulated device's tools. `devsim init DIR` writes a complete
// default device root.
#include <CLI/CLI.hpp>

#include <cstdio>
#include <filesystem>
#include <string>

#include "tools/default_root.h"

namespace {

// The support library built beside devsim; found from devsim's own place
// first, so a moved build tree still works, then where the build put it.
std::string SupportLibrary() {
  std::error_code ec;
  const auto self = std::filesystem::read_symlink("/proc/self/exe", ec);
  if (!ec) {
    const auto beside = self.parent_path().parent_path() / "platform" / "FaultkeepSupport";
    if (std::filesystem::exists(beside, ec)) return beside.string();
  }
  return FAULTKEEP_SUPPORT_LIBRARY;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"Simulated device tools"};
  app.require_subcommand(1);
  std::string dir;
  bool force = false;
  auto* init = app.add_subcommand("init", "Write a complete default device root into DIR");
  init->add_option("DIR", dir)->required();
  init->add_flag("--force", force, "write into a non-empty DIR, replacing the files it writes");
  try {
    app.parse(argc, argv);
  } catch (const CLI::CallForHelp& e) {
    return app.exit(e);
  } catch (const CLI::ParseError& e) {
    app.exit(e);
    return 2;
  }
  if (init->parsed()) {
    std::error_code ec;
    if (std::filesystem::exists(dir, ec) && !std::filesystem::is_directory(dir, ec)) {
      std::fprintf(stderr, "devsim: %s exists and is not a directory\n", dir.c_str());
      return 2;
    }
    if (!force && std::filesystem::exists(dir, ec) && !std::filesystem::is_empty(dir, ec)) {
      std::fprintf(stderr, "devsim: %s is not empty (use --force to write into it)\n", dir.c_str());
      return 2;
    }
    std::string error;
    if (!WriteDefaultRoot(std::filesystem::absolute(dir).string(), SupportLibrary(), &error)) {
      std::fprintf(stderr, "devsim: %s\n", error.c_str());
      return 1;
    }
    std::printf("%s\n", std::filesystem::absolute(dir).string().c_str());
  }
  return 0;
}
