// tallyrun under a service manager: the listening socket handed over at
// start, and the install that puts the programs, the support library and
// the units in place.
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <cstring>
#include <fstream>
#include <sstream>

#include "root_fixture.h"

namespace {

namespace fs = std::filesystem;
using HandedSocketTest = RootTest;

const std::string kSocketName = "var/run/com.velmora.tallybookd.tallyrun.sock";

// A Unix socket of the type bound at path (listening when a stream).
int BoundSocket(const std::string& path, int type) {
  const int fd = socket(AF_UNIX, type, 0);  // inherited: no close-on-exec
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
  if (fd < 0 || bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 ||
      (type == SOCK_STREAM && listen(fd, 16) != 0)) {
    ADD_FAILURE() << "cannot make the socket at " << path << ": " << std::strerror(errno);
    return -1;
  }
  return fd;
}

ino_t Inode(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0 ? st.st_ino : 0;
}

TEST_F(HandedSocketTest, ServesTheSocketItIsHandedAndLeavesItsPath) {
  enum class Hand { kListening, kListeningWhileBusy, kDatagram, kElsewhere, kTwo, kNoDescriptor, kBadCount, kOtherProcess };
  struct Case {
    const char* name;
    Hand hand;
    const char* refusal;  // the reason in the error line; null when served
  };
  const Case cases[] = {
      {"one listening stream socket at the path", Hand::kListening, nullptr},
      // Leaving would hand the socket back unread, to be started again at once.
      {"the same while a daily run holds the instance lock", Hand::kListeningWhileBusy, nullptr},
      {"a datagram socket", Hand::kDatagram, "it is not a listening Unix stream socket"},
      {"a socket bound elsewhere", Hand::kElsewhere, "it is not bound to "},
      {"two sockets", Hand::kTwo, "2 sockets were handed over, not one"},
      {"a count without the descriptor", Hand::kNoDescriptor, "the announcement is broken (Bad file descriptor)"},
      {"a count that is no number", Hand::kBadCount, "the announcement is broken (Invalid argument)"},
      // Meant for another process: a start by hand, which binds and removes.
      {"an announcement for another process", Hand::kOtherProcess, nullptr},
  };
  const std::string socket_path = root / kSocketName;
  const std::string elsewhere = root / "var/run/elsewhere.sock";
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    fs::create_directories(root / "var/run");
    std::vector<int> handed;
    std::string count = "1";
    switch (c.hand) {
      case Hand::kListening: case Hand::kListeningWhileBusy: handed = {BoundSocket(socket_path, SOCK_STREAM)}; break;
      case Hand::kDatagram: handed = {BoundSocket(socket_path, SOCK_DGRAM)}; break;
      case Hand::kElsewhere: handed = {BoundSocket(elsewhere, SOCK_STREAM)}; break;
      case Hand::kTwo:
        handed = {BoundSocket(socket_path, SOCK_STREAM), BoundSocket(elsewhere, SOCK_STREAM)};
        count = "2";
        break;
      case Hand::kNoDescriptor: case Hand::kOtherProcess: break;
      case Hand::kBadCount: count = "one"; break;
    }
    const ino_t handed_inode = Inode(socket_path);
    int lock = -1;
    if (c.hand == Hand::kListeningWhileBusy) {
      lock = open((root / "var/run/tallyrun.lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
      ASSERT_EQ(flock(lock, LOCK_EX), 0);
    }

    const std::string err_file = root / "service.stderr";
    const pid_t pid = fork();
    if (pid == 0) {
      freopen(err_file.c_str(), "w", stderr);
      for (const auto& [k, v] : env) setenv(k.c_str(), v.c_str(), 1);
      // Out of the way first, so that moving one to 3 cannot close another.
      std::vector<int> high;
      for (int fd : handed) high.push_back(fcntl(fd, F_DUPFD, 20));
      close(3);
      close(4);
      for (size_t i = 0; i < high.size(); ++i) dup2(high[i], 3 + static_cast<int>(i));
      setenv("LISTEN_FDS", count.c_str(), 1);
      setenv("LISTEN_PID", std::to_string(c.hand == Hand::kOtherProcess ? getppid() : getpid()).c_str(), 1);
      execl(TALLYRUN_BIN, TALLYRUN_BIN, static_cast<char*>(nullptr));
      _exit(127);
    }
    // A handed-over socket takes peers before the service accepts them, as
    // it would under the manager; one bound by the service must appear first.
    if (c.hand == Hand::kOtherProcess)
      for (int i = 0; i < 500 && !platform::FileExists(socket_path); ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    if (!c.refusal) {
      EXPECT_EQ(Tallyctl({"run-day", "20000"}).status, 0);
    }
    if (lock >= 0) {
      std::this_thread::sleep_for(std::chrono::seconds(1));
      EXPECT_EQ(waitpid(pid, nullptr, WNOHANG), 0) << "it waits for the lock instead of leaving";
      close(lock);
    }
    int status = 0;
    if (!WaitOrKill(pid, 30, &status)) ADD_FAILURE() << "the service did not end";
    const std::string err = platform::ReadFile(err_file).value_or("");
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << err;

    if (c.refusal) {
      EXPECT_EQ(Count(err, "<error>: Not serving the socket handed over at start: " + std::string(c.refusal)), 1u)
          << err;
      EXPECT_EQ(Count(err, "<error>"), 1u) << err;
      EXPECT_EQ(Count(err, "daily tasks"), 0u);
      // It bound nothing of its own and left what was there.
      EXPECT_EQ(Inode(socket_path), handed_inode);
    } else {
      EXPECT_EQ(Count(err, "daily tasks for day 20000"), 1u) << err;
      EXPECT_EQ(Count(err, "<error>"), 0u) << err;
      if (c.hand == Hand::kOtherProcess) {
        EXPECT_FALSE(platform::FileExists(socket_path)) << "a socket it bound is removed at exit";
      } else {
        EXPECT_NE(handed_inode, 0u);
        EXPECT_EQ(Inode(socket_path), handed_inode) << "the manager's socket stays where it was";
      }
    }
    for (int fd : handed) close(fd);
    fs::remove(socket_path);
    fs::remove(elsewhere);
  }
}

std::string ReadText(const std::string& path) {
  std::ifstream in(path);
  std::stringstream s;
  s << in.rdbuf();
  return s.str();
}

// "key=value" lines of a unit file, each with its section ("[Socket]ListenStream=...").
std::vector<std::string> UnitLines(const std::string& path) {
  std::vector<std::string> out;
  std::istringstream in(ReadText(path));
  std::string section, line;
  while (std::getline(in, line)) {
    if (line.empty() || line[0] == '#') continue;
    if (line[0] == '[') section = line;
    else out.push_back(section + line);
  }
  return out;
}

bool Has(const std::vector<std::string>& lines, const std::string& line) {
  return std::find(lines.begin(), lines.end(), line) != lines.end();
}

RunResult Install(const std::string& prefix, const std::string& destdir) {
  std::map<std::string, std::string> env;
  if (!destdir.empty()) env["DESTDIR"] = destdir;
  return RunProgram(CMAKE_COMMAND, {"--install", BUILD_DIR, "--prefix", prefix}, env);
}

// Where the units land for an install with this prefix.
std::string UnitDir(const std::string& prefix) {
  const std::string dir = SYSTEMD_UNIT_DIR;
  return (dir[0] == '/' ? dir : prefix + "/" + dir) + "/";
}

const std::vector<std::string> kUnits = {"tallyrun.service", "tallyrun.socket", "tallyrun-daily.service",
                                         "tallyrun-daily.timer"};

TEST(InstallTest, PutsProgramsLibraryAndUnitsInPlace) {
  TempDir stage;
  const RunResult r = Install("/usr", stage.path());
  ASSERT_EQ(r.status, 0) << r.out << r.err;
  const std::string usr = stage / "usr";
  for (const char* program : {"tallyrun", "tallybook", "tallyctl", "devsim"}) {
    SCOPED_TRACE(program);
    const std::string path = usr + "/" + INSTALL_BINDIR + "/" + program;
    struct stat st;
    ASSERT_EQ(stat(path.c_str(), &st), 0);
    EXPECT_TRUE(S_ISREG(st.st_mode));
    EXPECT_EQ(st.st_mode & 0111, 0111u);
  }
  const std::string library = usr + "/" + SUPPORT_INSTALL_DIR + "/FaultkeepSupport";
  EXPECT_EQ(ReadText(library).substr(0, 4), "\x7f" "ELF") << library;

  const std::string root = TALLYRUN_DEVICE_ROOT;
  const std::string units = stage.path() + UnitDir("/usr");
  const auto socket = UnitLines(units + "tallyrun.socket");
  EXPECT_TRUE(Has(socket, "[Socket]ListenStream=" + root + "/var/run/com.velmora.tallybookd.tallyrun.sock"));
  EXPECT_TRUE(Has(socket, "[Socket]SocketMode=0600"));
  EXPECT_TRUE(Has(socket, "[Install]WantedBy=sockets.target"));
  const auto service = UnitLines(units + "tallyrun.service");
  EXPECT_TRUE(Has(service, "[Service]Environment=TALLYRUN_ROOT=" + root));
  // The prefix of the install, not the one the build was configured with.
  const std::string tallyrun = std::string("/usr/") + INSTALL_BINDIR + "/tallyrun";
  EXPECT_TRUE(Has(service, "[Service]ExecStart=" + tallyrun));
  const auto daily = UnitLines(units + "tallyrun-daily.service");
  EXPECT_TRUE(Has(daily, "[Service]Environment=TALLYRUN_ROOT=" + root));
  EXPECT_TRUE(Has(daily, "[Service]ExecStart=" + tallyrun + " -d"));
  // The run's record decides the unit's result.
  EXPECT_TRUE(Has(daily, "[Service]ExecStartPost=/usr/" + std::string(INSTALL_BINDIR) + "/tallybook status"));
  const auto timer = UnitLines(units + "tallyrun-daily.timer");
  EXPECT_TRUE(Has(timer, "[Timer]OnCalendar=daily"));
  EXPECT_TRUE(Has(timer, "[Timer]Persistent=true"));
  EXPECT_TRUE(Has(timer, "[Install]WantedBy=timers.target"));
  for (const std::string& unit : kUnits) {
    SCOPED_TRACE(unit);
    const std::string text = ReadText(units + unit);
    EXPECT_FALSE(text.empty());
    EXPECT_EQ(text.find('@'), std::string::npos) << "a template variable left unexpanded";
  }
}

TEST(InstallTest, UnitsPassSystemdAnalyzeVerify) {
  std::string analyze;
  for (const char* dir : {"/usr/bin", "/bin", "/usr/local/bin"})
    if (access((std::string(dir) + "/systemd-analyze").c_str(), X_OK) == 0) analyze = std::string(dir) + "/systemd-analyze";
  if (analyze.empty()) GTEST_SKIP() << "systemd-analyze is not installed; the units are not checked";
  if (SYSTEMD_UNIT_DIR[0] == '/' || INSTALL_BINDIR[0] == '/')
    GTEST_SKIP() << "this build installs outside its prefix; the units are not checked here";
  // Installed into a real prefix, so that the programs the units start exist.
  TempDir prefix;
  const RunResult install = Install(prefix.path(), "");
  ASSERT_EQ(install.status, 0) << install.out << install.err;
  std::vector<std::string> args = {"verify", "--man=no"};
  for (const std::string& unit : kUnits) args.push_back(prefix.path() + UnitDir("") + unit);
  const RunResult r = RunProgram(analyze, args, {});
  std::printf("systemd-analyze verify: exit %d%s%s\n", r.status, r.err.empty() ? ", no findings" : "\n",
              r.err.c_str());
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(r.err, "") << "every finding is a fault in a unit";
}

}  // namespace
