// A fresh device root made by devsim, and helpers to run the programs in it
// and read what they leave on disk.
#pragma once

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <thread>

#include "../temp_dir.h"
#include "cf/plist.h"
#include "platform/device_root.h"
#include "platform/files.h"
#include "run.h"

inline const std::string kDomain = "com.velmora.tallybookd.tallyrun";
inline const std::string kGate = "LastCrashLogSerializationDateInDaysSince1970";
constexpr int32_t kToday = 20779;  // 2026-11-22

inline cf::Value ReadPlist(const std::string& path) {
  const auto bytes = platform::ReadFile(path);
  if (!bytes) return {};
  return cf::ParsePropertyList(*bytes).value;
}

// Waits up to `seconds` for the child to end, then kills it; its wait status
// goes to status. True when it ended on its own.
inline bool WaitOrKill(pid_t pid, int seconds, int* status) {
  for (int i = 0; i < seconds * 100; ++i) {
    if (waitpid(pid, status, WNOHANG) != 0) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  kill(pid, SIGKILL);
  waitpid(pid, status, 0);
  return false;
}

class RootTest : public ::testing::Test {
 protected:
  void SetUp() override {
    const RunResult init = RunProgram(DEVSIM_BIN, {"init", root.path(), "--force"}, env);
    ASSERT_EQ(init.status, 0) << init.err;
  }

  RunResult Tallyrun(const std::vector<std::string>& args) { return RunProgram(TALLYRUN_BIN, args, env); }
  RunResult Tallyctl(const std::vector<std::string>& args) { return RunProgram(TALLYCTL_BIN, args, env); }

  std::vector<std::string> Logs() {
    std::vector<std::string> out;
    std::error_code ec;
    for (const auto& e : std::filesystem::directory_iterator(root / "var/diagvault/submissions", ec))
      if (e.path().extension() == ".193") out.push_back(e.path());
    // Oldest first. Logs of one second share a stamp and differ by their
    // "-N" suffix, so order by the suffix's number.
    auto suffix = [](const std::string& p) {
      const size_t dot = p.rfind('.'), dash = p.rfind('-');
      return dash != std::string::npos && dash > p.rfind('_') && dash < dot && dot - dash < 6
                 ? std::stoi(p.substr(dash + 1, dot - dash - 1))
                 : 0;
    };
    std::sort(out.begin(), out.end(), [&](const std::string& a, const std::string& b) {
      const std::string sa = a.substr(0, a.rfind('_') + 18), sb = b.substr(0, b.rfind('_') + 18);
      return sa != sb ? sa < sb : suffix(a) < suffix(b);
    });
    return out;
  }
  cf::Dictionary LastLog() {
    const auto logs = Logs();
    if (logs.empty()) return {};
    const cf::Value v = ReadPlist(logs.back());
    return v.AsDictionary() ? *v.AsDictionary() : cf::Dictionary();
  }
  cf::Value Pref(const std::string& key) {
    const cf::Value v = ReadPlist(root / ("Library/Preferences/" + kDomain + ".plist"));
    return v.AsDictionary() ? v.AsDictionary()->Get(key) : cf::Value();
  }
  void WritePlist(const std::string& rel, const cf::Value& v) {
    std::string bytes;
    ASSERT_TRUE(cf::WriteXMLPropertyList(v, bytes, nullptr));
    ASSERT_TRUE(platform::WriteFileAtomically(root / rel, bytes));
  }

  // Service mode: starts tallyrun without arguments, waits for its socket,
  // sends the messages with tallyctl, and waits for the process to end.
  RunResult Serve(const std::vector<std::vector<std::string>>& messages) {
    const std::string err_file = root / "service.stderr";
    const pid_t pid = fork();
    if (pid == 0) {
      freopen(err_file.c_str(), "w", stderr);
      for (const auto& [k, v] : env) setenv(k.c_str(), v.c_str(), 1);
      execl(TALLYRUN_BIN, TALLYRUN_BIN, static_cast<char*>(nullptr));
      _exit(127);
    }
    const std::string socket = root / "var/run/com.velmora.tallybookd.tallyrun.sock";
    for (int i = 0; i < 500 && !platform::FileExists(socket); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));
    for (const auto& m : messages) EXPECT_EQ(Tallyctl(m).status, 0);
    RunResult r;
    int status = 0;
    WaitOrKill(pid, 60, &status);
    r.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    r.err = platform::ReadFile(err_file).value_or("");
    EXPECT_FALSE(platform::FileExists(socket)) << "the socket is removed at exit";
    return r;
  }

  TempDir root;
  std::map<std::string, std::string> env{{"TALLYRUN_ROOT", root.path()},
                                         {"TALLYRUN_NOW", "2026-11-22T15:00:00Z"},
                                         {"TZ", "UTC0"},
                                         {"TALLYRUN_LOG_STDERR", "1"},
                                         {"TALLYRUN_SERVICE_IDLE_SECONDS", "2"}};
};

inline size_t Count(const std::string& haystack, const std::string& needle) {
  size_t n = 0;
  for (size_t at = haystack.find(needle); at != std::string::npos; at = haystack.find(needle, at + 1)) ++n;
  return n;
}

