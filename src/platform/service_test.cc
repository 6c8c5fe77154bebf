#include "platform/service.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <thread>

#include "../../tests/temp_dir.h"
#include "cf/plist.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"

namespace platform {
namespace {

constexpr const char* kName = "com.velmora.test.service";

// Writes raw bytes to the service from a helper thread, as a peer process would.
void SendRaw(const std::string& path, const std::string& bytes) {
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strcpy(addr.sun_path, path.c_str());
  const int fd = socket(AF_UNIX, SOCK_STREAM, 0);
  if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0) (void)!write(fd, bytes.data(), bytes.size());
  close(fd);
}

std::string Frame(uint32_t length, const std::string& body) {
  std::string f{static_cast<char>(length >> 24), static_cast<char>(length >> 16), static_cast<char>(length >> 8),
                static_cast<char>(length)};
  return f + body;
}

TEST(ServiceTest, MessagesReachTheHandlerAndBadFramesOnlyEndTheirConnection) {
  TempDir root;
  auto log = std::make_shared<CaptureLog>();
  ContextScope scope(root.path(), Backends{nullptr, log});
  const std::string path = ServiceSocketPath(kName);

  std::vector<cf::Value> messages;
  int errors = 0;
  xpc_connection_t listener = xpc_connection_create_mach_service(kName, XPC_CONNECTION_MACH_SERVICE_LISTENER);
  ASSERT_NE(listener, nullptr);
  struct stat st;
  ASSERT_EQ(stat(path.c_str(), &st), 0);
  EXPECT_TRUE(S_ISSOCK(st.st_mode));
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  xpc_connection_set_event_handler(listener, [&](const XPCEvent& e) {
    ASSERT_EQ(e.type, XPCEvent::Type::kConnection);
    xpc_connection_set_event_handler(e.connection, [&](const XPCEvent& m) {
      if (m.type == XPCEvent::Type::kDictionary) messages.push_back(m.message);
      else ++errors;
    });
    xpc_connection_resume(e.connection);
  });
  xpc_connection_resume(listener);

  cf::Dictionary message;
  message.Set("operation", cf::Value::SInt64(2));
  message.Set("uuid", cf::Value::Bytes(cf::Data(16, 0xab)));
  std::string good;
  ASSERT_TRUE(EncodeServiceFrame(message, &good, nullptr));
  std::string array_body;
  ASSERT_TRUE(cf::WriteBinaryPropertyList(cf::Array(), array_body, nullptr));

  std::thread peer([&] {
    SendRaw(path, good + good);                                    // two messages, one connection
    SendRaw(path, Frame(1 << 21, ""));                             // over 1 MiB
    SendRaw(path, Frame(static_cast<uint32_t>(array_body.size()), array_body));  // not a dictionary
    SendRaw(path, good.substr(0, good.size() - 3));                // closes mid-frame
    SendRaw(path, Frame(5, "junk!"));                              // not a property list
    std::string error;
    SendServiceMessage(kName, message, &error);                    // still serving
  });
  const auto until = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (messages.size() < 3 && std::chrono::steady_clock::now() < until) CFRunLoopRunInMode(1.0, true);
  peer.join();
  while (CFRunLoopRunInMode(0.2, true) != kCFRunLoopRunTimedOut) {
  }
  ASSERT_EQ(messages.size(), 3u);
  EXPECT_EQ(messages[0], cf::Value(message));
  EXPECT_EQ(xpc_dictionary_get_int64(messages[0], "operation"), 2);
  EXPECT_EQ(xpc_dictionary_get_int64(messages[0], "missing"), 0);
  EXPECT_EQ(xpc_dictionary_get_int64(cf::Value("not a dictionary"), "operation"), 0);
  EXPECT_EQ(uuid_unparse(*xpc_dictionary_get_uuid(messages[0], "uuid")), "ABABABAB-ABAB-ABAB-ABAB-ABABABABABAB");
  EXPECT_FALSE(xpc_dictionary_get_uuid(messages[0], "operation"));
  EXPECT_EQ(log->CountContaining("over the limit of 1048576"), 1u);
  EXPECT_EQ(log->Count("Bad service message (an array, not a dictionary); closing the connection"), 1u);
  EXPECT_EQ(log->Count("Service peer closed the connection in the middle of a message"), 1u);
  EXPECT_EQ(log->CountContaining("Bad service message (malformed binary property list)"), 0u);
  EXPECT_EQ(log->CountContaining("Bad service message ("), 2u);  // the array and the junk
  EXPECT_GE(errors, 2);

  xpc_connection_cancel(listener);
  EXPECT_FALSE(FileExists(path));
  std::string error;
  EXPECT_FALSE(SendServiceMessage(kName, message, &error));
  EXPECT_NE(error.find("no service listening at " + path), std::string::npos) << error;
}

// A client socket connected to path (it waits in the backlog until accepted).
int Connect(const std::string& path) {
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strcpy(addr.sun_path, path.c_str());
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd >= 0 && connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
    close(fd);
    return -1;
  }
  return fd;
}

// A listener that keeps and resumes every peer, counting their messages.
struct Server {
  xpc_connection_t listener = xpc_connection_create_mach_service(kName, XPC_CONNECTION_MACH_SERVICE_LISTENER);
  std::vector<xpc_connection_t> peers;
  size_t messages = 0;

  Server() {
    if (!listener) return;
    xpc_connection_set_event_handler(listener, [this](const XPCEvent& e) {
      peers.push_back(e.connection);
      xpc_connection_set_event_handler(e.connection, [this](const XPCEvent& m) {
        if (m.type == XPCEvent::Type::kDictionary) ++messages;
      });
      xpc_connection_resume(e.connection);
    });
    xpc_connection_resume(listener);
  }
  ~Server() {
    for (auto& p : peers) xpc_connection_cancel(p);
    xpc_connection_cancel(listener);
  }
  // Runs the loop until it has nothing more to do for a moment.
  void Drain() {
    while (CFRunLoopRunInMode(0.2, true) != kCFRunLoopRunTimedOut) {
    }
  }
  void RunUntilMessages(size_t n) {
    for (int i = 0; i < 40 && messages < n; ++i) CFRunLoopRunInMode(0.5, true);
  }
  void RunUntilPeers(size_t n) {
    for (int i = 0; i < 40 && peers.size() < n; ++i) CFRunLoopRunInMode(0.5, true);
  }
};

std::string GoodFrame() {
  cf::Dictionary message;
  message.Set("operation", cf::Value::SInt64(2));
  std::string frame;
  EncodeServiceFrame(message, &frame, nullptr);
  return frame;
}

TEST(ServiceTest, TheSocketPathIsTakenOnlyFromADeadListener) {
  TempDir root;
  auto log = std::make_shared<CaptureLog>();
  ContextScope scope(root.path(), Backends{nullptr, log});
  const std::string path = ServiceSocketPath(kName);

  // Not a socket: reported, left alone, not served.
  ASSERT_TRUE(WriteFileAtomically(path, "keep me"));
  EXPECT_EQ(xpc_connection_create_mach_service(kName, XPC_CONNECTION_MACH_SERVICE_LISTENER), nullptr);
  EXPECT_EQ(log->Count(path + " is not a socket; leaving it alone and not serving"), 1u);
  EXPECT_EQ(ReadFile(path), "keep me");
  ASSERT_EQ(unlink(path.c_str()), 0);

  // A socket nobody answers (its process died) is replaced.
  {
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::strcpy(addr.sun_path, path.c_str());
    const int dead = socket(AF_UNIX, SOCK_STREAM, 0);
    ASSERT_EQ(bind(dead, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
    close(dead);
  }
  {
    Server first;
    ASSERT_NE(first.listener, nullptr);
    EXPECT_EQ(log->Count("Removed the stale socket " + path), 1u);

    // A live one belongs to another instance: never unlinked or taken over.
    struct stat before, after;
    ASSERT_EQ(stat(path.c_str(), &before), 0);
    EXPECT_EQ(xpc_connection_create_mach_service(kName, XPC_CONNECTION_MACH_SERVICE_LISTENER), nullptr);
    EXPECT_EQ(log->Count("Another instance serves " + path + "; not taking it over"), 1u);
    ASSERT_EQ(stat(path.c_str(), &after), 0);
    EXPECT_EQ(after.st_ino, before.st_ino);
    const int client = Connect(path);
    ASSERT_GE(client, 0);
    const std::string frame = GoodFrame();
    ASSERT_EQ(write(client, frame.data(), frame.size()), static_cast<ssize_t>(frame.size()));
    close(client);
    first.Drain();
    EXPECT_EQ(first.messages, 1u);  // the first instance still serves
  }
  EXPECT_FALSE(FileExists(path));  // and removes its socket at the end

  // A listener removes the socket at its path only while it is its own.
  Server replaced;
  ASSERT_NE(replaced.listener, nullptr);
  ASSERT_EQ(unlink(path.c_str()), 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strcpy(addr.sun_path, path.c_str());
  const int other = socket(AF_UNIX, SOCK_STREAM, 0);
  ASSERT_EQ(bind(other, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
  xpc_connection_cancel(replaced.listener);
  EXPECT_TRUE(FileExists(path));
  close(other);
}

TEST(ServiceTest, ConnectionsBeyondTheCapWaitInTheBacklog) {
  TempDir root;
  auto log = std::make_shared<CaptureLog>();
  ContextScope scope(root.path(), Backends{nullptr, log});
  Server server;
  ASSERT_NE(server.listener, nullptr);
  const std::string frame = GoodFrame();
  std::vector<int> clients;
  for (size_t i = 0; i < kMaxServiceConnections + 2; ++i) {
    const int fd = Connect(ServiceSocketPath(kName));
    ASSERT_GE(fd, 0);
    ASSERT_EQ(write(fd, frame.data(), frame.size()), static_cast<ssize_t>(frame.size()));
    clients.push_back(fd);
    server.RunUntilMessages(std::min(i + 1, kMaxServiceConnections));
  }
  server.Drain();
  EXPECT_EQ(server.peers.size(), kMaxServiceConnections);
  EXPECT_EQ(server.messages, kMaxServiceConnections);
  // A peer that goes makes room for one that waited; its message was kept.
  close(clients[0]);
  server.Drain();
  EXPECT_EQ(server.peers.size(), kMaxServiceConnections + 1);
  EXPECT_EQ(server.messages, kMaxServiceConnections + 1);
  for (size_t i = 1; i < clients.size(); ++i) close(clients[i]);
  server.Drain();
  EXPECT_EQ(server.peers.size(), kMaxServiceConnections + 2);
  EXPECT_EQ(server.messages, kMaxServiceConnections + 2);
}

TEST(ServiceTest, OutOfDescriptorsQueuedMessagesAreServedAndTheListenerPausesInsteadOfSpinning) {
  TempDir root;
  auto log = std::make_shared<CaptureLog>();
  ContextScope scope(root.path(), Backends{nullptr, log});
  Server server;
  ASSERT_NE(server.listener, nullptr);
  const std::string frame = GoodFrame();
  int clients[2];
  for (int& client : clients) {
    client = Connect(ServiceSocketPath(kName));
    ASSERT_GE(client, 0);
    ASSERT_EQ(write(client, frame.data(), frame.size()), static_cast<ssize_t>(frame.size()));
  }

  // Use up every descriptor, so accept fails with EMFILE.
  rlimit saved;
  ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &saved), 0);
  rlimit low = saved;
  low.rlim_cur = std::min<rlim_t>(saved.rlim_cur, 256);
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &low), 0);
  const int null_fd = open("/dev/null", O_RDONLY | O_CLOEXEC);
  ASSERT_GE(null_fd, 0);
  std::vector<int> filler;
  for (int fd; (fd = dup(null_fd)) >= 0;) filler.push_back(fd);
  // The first peer gets the descriptor held in reserve; the second waits,
  // and the listener pauses rather than spin.
  const uint64_t polls = testing::ServicePollCalls();
  EXPECT_EQ(CFRunLoopRunInMode(0.5, false), kCFRunLoopRunTimedOut);
  const uint64_t spent = testing::ServicePollCalls() - polls;
  EXPECT_EQ(server.messages, 1u);
  // A spinning loop polls hundreds of thousands of times in half a second;
  // pausing 100 ms after each failure polls about twice per pause.
  EXPECT_LE(spent, 30u) << spent;
  EXPECT_EQ(log->Count("Cannot accept a service connection (Too many open files); pausing the listener"), 1u);
  // When the first peer goes, its descriptor is the reserve again, and the
  // waiting one is served, still at the limit.
  close(clients[0]);
  filler.push_back(dup(null_fd));  // the test shares the process: stay at the limit
  ASSERT_GE(filler.back(), 0);
  EXPECT_EQ(CFRunLoopRunInMode(0.5, false), kCFRunLoopRunTimedOut);
  EXPECT_EQ(server.messages, 2u);
  EXPECT_EQ(log->Count("Out of file descriptors: a service connection took the one held in reserve"), 2u);
  for (int fd : filler) close(fd);
  close(null_fd);
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &saved), 0);
  close(clients[1]);
  server.Drain();
  EXPECT_EQ(server.messages, 2u);
}

TEST(ServiceTest, AFrameHoldsOnlyTheBytesThatArrived) {
  TempDir root;
  auto log = std::make_shared<CaptureLog>();
  ContextScope scope(root.path(), Backends{nullptr, log});
  Server server;
  ASSERT_NE(server.listener, nullptr);
  const std::string path = ServiceSocketPath(kName);

  // Frames that announce 1 MiB but send ten bytes.
  std::vector<int> clients;
  for (int i = 0; i < 20; ++i) {
    clients.push_back(Connect(path));
    ASSERT_GE(clients.back(), 0);
    const std::string partial = Frame(kMaxServiceFrame, std::string(10, 'x'));
    ASSERT_EQ(write(clients.back(), partial.data(), partial.size()), static_cast<ssize_t>(partial.size()));
    server.RunUntilPeers(clients.size());
  }
  server.Drain();
  EXPECT_LE(testing::ServiceBufferedBytes(), 20u * 4096);
  for (int fd : clients) close(fd);
  server.Drain();
  EXPECT_EQ(log->Count("Service peer closed the connection in the middle of a message"), 20u);

  // A large message delivered leaves no large buffer behind on an idle peer.
  cf::Dictionary big;
  big.Set("padding", cf::Value::Bytes(cf::Data(kMaxServiceFrame - 1024, 1)));
  std::string frame;
  ASSERT_TRUE(EncodeServiceFrame(big, &frame, nullptr));
  const int client = Connect(path);
  ASSERT_GE(client, 0);
  std::thread writer([&] { (void)!write(client, frame.data(), frame.size()); });
  server.RunUntilMessages(1);
  writer.join();
  server.Drain();
  EXPECT_LE(testing::ServiceBufferedBytes(), 4096u);
  close(client);
  server.Drain();
}

TEST(ServiceTest, AFileWhereTheSocketDirectoryBelongsIsReportedAsSuch) {
  TempDir root;
  auto log = std::make_shared<CaptureLog>();
  ContextScope scope(root.path(), Backends{nullptr, log});
  ASSERT_TRUE(WriteFileAtomically(root / "var/run", "a file in the way"));
  EXPECT_EQ(xpc_connection_create_mach_service(kName, XPC_CONNECTION_MACH_SERVICE_LISTENER), nullptr);
  EXPECT_EQ(log->Count("Cannot create the directory of " + ServiceSocketPath(kName) + ": Not a directory"), 1u);
}

TEST(ServiceTest, RunLoopWithoutSourcesWaitsOutItsTime) {
  const auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(CFRunLoopRunInMode(0.3, true), kCFRunLoopRunTimedOut);
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(290));
}

TEST(ServiceTest, UuidText) {
  const auto u = uuid_parse("0123abcd-4567-89ef-0123-456789ABCDEF");
  ASSERT_TRUE(u);
  EXPECT_EQ(uuid_unparse(*u), "0123ABCD-4567-89EF-0123-456789ABCDEF");
  for (const char* bad : {"", "0123abcd-4567-89ef-0123-456789abcde", "0123abcd-4567-89ef-0123-456789abcdeg",
                          "0123abcd_4567-89ef-0123-456789abcdef", "0123abcd-4567-89ef-0123-456789abcdef0"})
    EXPECT_FALSE(uuid_parse(bad)) << bad;
}

}  // namespace
}  // namespace platform
