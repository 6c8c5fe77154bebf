// tallyrun under a service manager: the listening socket handed over at
// start.
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <cstring>

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
    for (int i = 0; i < 3000 && waitpid(pid, &status, WNOHANG) == 0; ++i)
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    if (waitpid(pid, &status, WNOHANG) == 0) {
      kill(pid, SIGKILL);
      waitpid(pid, &status, 0);
      ADD_FAILURE() << "the service did not end";
    }
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

}  // namespace
