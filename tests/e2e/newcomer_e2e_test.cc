// The mistakes a person makes on a first day with the tools, and the reset
// of a root: each gets a message that says what to do instead.
#include <set>

#include "root_fixture.h"

namespace {

namespace fs = std::filesystem;

class NewcomerTest : public RootTest {};

// Every file and directory below dir, relative to it.
std::set<std::string> Tree(const std::string& dir) {
  std::set<std::string> out;
  for (const auto& e : fs::recursive_directory_iterator(dir)) out.insert(fs::relative(e.path(), dir).string());
  return out;
}

TEST_F(NewcomerTest, MistakesGetMessagesThatHelp) {
  const std::string empty_header = root / "empty-header";
  const std::string snapshot = root / "snapshot";
  ASSERT_TRUE(platform::WriteFileAtomically(empty_header, ""));
  ASSERT_TRUE(platform::WriteFileAtomically(snapshot, std::string(252, '\1')));
  const std::string day_help = "; `tallybook today` prints today's day number\n";
  const std::string clock_forms =
      "\" is not a moment: give epoch seconds (1795435200) or an ISO-8601 date or date-time (2026-11-22, "
      "2026-11-22T10:00:00, 2026-11-22T10:00:00Z, 2026-11-22T10:00:00+02:00), or unset it\n";
  struct Case {
    const char* program;
    std::vector<std::string> args;
    std::string message;  // the whole of standard error
    const char* now = "2026-11-22T15:00:00Z";  // TALLYRUN_NOW
  } cases[] = {
      // A mistyped moment is never replaced by the real clock.
      {TALLYBOOK_BIN, {"set", "k", "1"}, "tallybook: TALLYRUN_NOW=\"2026-11-2" + clock_forms, "2026-11-2"},
      {TALLYBOOK_BIN, {"today"}, "tallybook: TALLYRUN_NOW=\"yesterday" + clock_forms, "yesterday"},
      {TALLYCTL_BIN, {"run-day", "1"}, "tallyctl: TALLYRUN_NOW=\"noon" + clock_forms, "noon"},
      {DEVSIM_BIN, {"init", root / "other"}, "devsim: TALLYRUN_NOW=\"2026-13-01" + clock_forms, "2026-13-01"},
      {TALLYBOOK_BIN, {"set", "k", "1", "--day", "2026-11-31"},
       "tallybook: expected a day number or an ISO date (YYYY-MM-DD), not '2026-11-31'" + day_help},
      // Nothing to run yet, or a day the service would truncate to another.
      {TALLYCTL_BIN, {"run-day", "2026-11-23"}, "tallyctl: day 2026-11-23 is after today (day 20779); nothing was sent\n"},
      {TALLYBOOK_BIN, {"frob"},
       "tallybook: unknown subcommand 'frob'; the subcommands are: set, add, push, dump, history, plot, today, status "
       "(--help for more)\n"},
      {TALLYCTL_BIN, {"frob", "1"},
       "tallyctl: unknown subcommand 'frob'; the subcommands are: logging-status, run-day, app-data, send, show "
       "(--help for more)\n"},
      {DEVSIM_BIN, {"frob"},
       "devsim: unknown subcommand 'frob'; the subcommands are: init, parse, controller, views, ioreport, snapshot "
       "(--help for more)\n"},
      {TALLYCTL_BIN, {"run-day", "yesterday"},
       "tallyctl: expected a day number or an ISO date (YYYY-MM-DD), not 'yesterday'" + day_help},
      {TALLYBOOK_BIN, {"dump", "--day", "2026-02-29"},  // not a leap year
       "tallybook: expected a day number or an ISO date (YYYY-MM-DD), not '2026-02-29'" + day_help},
      {TALLYBOOK_BIN, {"dump", "--day", "2026-1-22"},
       "tallybook: expected a day number or an ISO date (YYYY-MM-DD), not '2026-1-22'" + day_help},
      // Refused before any connection is tried: there is no service here.
      {TALLYCTL_BIN, {"run-day", "-1"}, "tallyctl: a day before 1970-01-01 cannot be run: -1\n"},
      {DEVSIM_BIN, {"init", ""}, "devsim: DIR is empty; name the directory to make the device root in\n"},
      {TALLYBOOK_BIN, {"set", "--day", "", "k", "1"}, "tallybook: --day needs a value, not empty text\n"},
      {TALLYBOOK_BIN, {"push", "k", "1", "--offset", ""}, "tallybook: --offset needs a value, not empty text\n"},
      {TALLYCTL_BIN, {"send", ""}, "tallyctl: OPERATION needs a value, not empty text\n"},
      {TALLYCTL_BIN, {"run-day", "4294987073"},
       "tallyctl: day 4294987073 is beyond the last day the service can take (2147483647); nothing was sent\n"},
      {TALLYCTL_BIN, {"send", "3"},
       "tallyctl: operation 3 is none the service knows (0 logging-status, 1 run-day, 2 app-data); it would "
       "still take the service's one turn; give --raw to send it anyway\n"},
      {DEVSIM_BIN, {"snapshot", snapshot, "--header", empty_header},
       "devsim: the snapshot header " + empty_header + " (0 bytes) describes no records; nothing to print\n"},
  };
  for (const Case& c : cases) {
    auto case_env = env;
    case_env["TALLYRUN_NOW"] = c.now;
    const RunResult r = RunProgram(c.program, c.args, case_env);
    EXPECT_EQ(r.status, 2) << c.args[0];
    EXPECT_EQ(r.err, c.message);
    EXPECT_EQ(r.out, "") << c.args[0];
  }

  // A date is that day; each tool warns under its own name.
  const RunResult by_date = RunProgram(TALLYBOOK_BIN, {"dump", "--day", "2026-11-21"}, env);
  const RunResult by_number = RunProgram(TALLYBOOK_BIN, {"dump", "--day", "20778"}, env);
  EXPECT_EQ(by_date.status, 0);
  EXPECT_FALSE(by_date.out.empty());
  EXPECT_EQ(by_date.out, by_number.out);
  EXPECT_FALSE(platform::FileExists(root / "other"));

  // Means print as the shortest text that reads back.
  ASSERT_EQ(RunProgram(TALLYBOOK_BIN, {"push", "newcomer.ratio", "0.58"}, env).status, 0);
  ASSERT_EQ(RunProgram(TALLYBOOK_BIN, {"push", "newcomer.ratio", "0.58"}, env).status, 0);
  EXPECT_EQ(RunProgram(TALLYBOOK_BIN, {"dump", "--prefix", "newcomer."}, env).out,
            "20779 newcomer.ratio 2 0.58 0.58 0.58\n");
}

TEST_F(NewcomerTest, ForceGivesTheRootAFreshInitGives) {
  ASSERT_EQ(Tallyrun({"-d"}).status, 0);
  ASSERT_FALSE(Logs().empty());
  ASSERT_TRUE(platform::WriteFileAtomically(root / "var/stray-file", "left by a person"));

  const RunResult again = RunProgram(DEVSIM_BIN, {"init", root.path(), "--force"}, env);
  ASSERT_EQ(again.status, 0) << again.err;
  EXPECT_NE(again.err.find("devsim: removed " + root / "var\n"), std::string::npos) << again.err;
  EXPECT_NE(again.err.find("devsim: removed " + root / "device\n"), std::string::npos);
  TempDir fresh;
  ASSERT_EQ(RunProgram(DEVSIM_BIN, {"init", fresh.path()}, env).status, 0);
  EXPECT_EQ(Tree(root.path()), Tree(fresh.path()));
  // So the gate is gone too: the day runs again.
  const RunResult r = Tallyrun({"-d"});
  EXPECT_EQ(Count(r.err, "Day unchanged since last run"), 0u) << r.err;
  EXPECT_EQ(Logs().size(), 1u);

  // Only a root devsim made is ever emptied: not a directory that merely
  // holds a var/ and a device/, not the home directory, never "/".
  TempDir home;
  ASSERT_TRUE(platform::WriteFileAtomically(home / "var/notes.txt", "mine"));
  ASSERT_TRUE(platform::WriteFileAtomically(home / "device/notes.txt", "mine"));
  auto home_env = env;
  home_env["HOME"] = home.path();
  const TempDir other;
  ASSERT_TRUE(fs::create_directory(other / "var"));
  for (const auto& [dir, message] : std::vector<std::pair<std::string, std::string>>{
           {other.path(), other.path() + " is not empty and is not a device root made by devsim init (no "
                                         ".tallyrun-root); not removing anything"},
           {home.path(), home.path() + " is never a device root; make one in a directory of its own"},
           {"/", "/ is never a device root; make one in a directory of its own"}}) {
    const RunResult refused = RunProgram(DEVSIM_BIN, {"init", dir, "--force"}, home_env);
    EXPECT_EQ(refused.status, 2) << dir;
    EXPECT_EQ(refused.err, "devsim: " + message + "\n");
  }
  EXPECT_EQ(platform::ReadFile(home / "var/notes.txt").value_or(""), "mine");
  EXPECT_TRUE(fs::is_directory(other / "var"));
}

}  // namespace
