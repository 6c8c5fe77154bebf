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
  struct Case {
    const char* program;
    std::vector<std::string> args;
    std::string message;  // the whole of standard error
  } cases[] = {
      {TALLYBOOK_BIN, {"frob"},
       "tallybook: unknown subcommand 'frob'; the subcommands are: set, add, push, dump, history, plot, today "
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
      {DEVSIM_BIN, {"snapshot", snapshot, "--header", empty_header},
       "devsim: the snapshot header " + empty_header + " (0 bytes) describes no records; nothing to print\n"},
  };
  for (const Case& c : cases) {
    const RunResult r = RunProgram(c.program, c.args, env);
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
  auto bad_clock = env;
  bad_clock["TALLYRUN_NOW"] = "noon";
  EXPECT_EQ(RunProgram(TALLYBOOK_BIN, {"today"}, bad_clock).err,
            "tallybook: ignoring TALLYRUN_NOW=\"noon\": not epoch seconds or an ISO-8601 date-time\n");

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

  // A directory that holds no root is never emptied.
  TempDir home;
  ASSERT_TRUE(platform::WriteFileAtomically(home / "notes.txt", "mine"));
  const RunResult refused = RunProgram(DEVSIM_BIN, {"init", home.path(), "--force"}, env);
  EXPECT_EQ(refused.status, 2);
  EXPECT_EQ(refused.err,
            "devsim: " + home.path() + " is not empty and holds no device root (no device/ or var/); not removing anything\n");
  EXPECT_EQ(platform::ReadFile(home / "notes.txt").value_or(""), "mine");
}

}  // namespace
