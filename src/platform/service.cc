#include "platform/service.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <thread>
#include <vector>

#include "cf/plist.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"

namespace platform {

class XPCConnection : public std::enable_shared_from_this<XPCConnection> {
 public:
  XPCConnection(int fd, bool listener, std::string path);
  ~XPCConnection() { Close(); }

  void Close();
  // Handles readiness; true when an event reached a handler.
  bool OnReady();

  int fd_;
  bool listener_;
  bool resumed_ = false;
  std::string path_;  // the socket file of a listener, removed on close
  dev_t socket_device_ = 0;  // which file at path_ is ours
  ino_t socket_inode_ = 0;
  xpc_handler_t handler_;
  ServiceFrameReader reader_;
  // A listener whose accept failed (out of descriptors) is not polled until
  // this time: its pending peer would make poll return at once, forever.
  std::chrono::steady_clock::time_point paused_until_{};
  bool accept_failing_ = false;
};

namespace {

constexpr auto kAcceptBackoff = std::chrono::milliseconds(100);

size_t g_open_peers = 0;
uint64_t g_poll_calls = 0;

// A descriptor held back while a listener is watched. Out of descriptors,
// it is given up to accept a waiting peer, so that a message queued on the
// socket is served rather than dropped at the idle exit; it is taken back
// when a peer goes.
int g_reserve_fd = -1;
void HoldReserveDescriptor() {
  if (g_reserve_fd < 0) g_reserve_fd = open("/dev/null", O_RDONLY | O_CLOEXEC);
}

// Connections the run loop watches, in the order they were resumed.
std::vector<xpc_connection_t>& Watched() {
  static std::vector<xpc_connection_t> watched;
  return watched;
}

void Unwatch(const XPCConnection* c) {
  auto& w = Watched();
  for (auto it = w.begin(); it != w.end(); ++it)
    if (it->get() == c) {
      w.erase(it);
      return;
    }
}

void Deliver(const xpc_handler_t& handler, XPCEvent event) {
  if (handler) handler(event);
}

// What the service manager announced at start. A broken announcement (a
// count that is no number, a descriptor that is not open) still counts as
// one, so that it is reported rather than taken for a start by hand.
struct HandedOver {
  bool announced = false;
  int count = 0;  // descriptors from SD_LISTEN_FDS_START on
  int error = 0;  // errno of a broken announcement
};

const HandedOver& TakeHandedOver() {
  static const HandedOver taken = [] {
    HandedOver h;
    const int n = sd_listen_fds(1);
    h.announced = n != 0;
    if (n < 0) h.error = -n;
    else h.count = n;
    return h;
  }();
  return taken;
}

uint32_t BigEndian32(const char* p) {
  const auto* u = reinterpret_cast<const unsigned char*>(p);
  return (uint32_t{u[0]} << 24) | (uint32_t{u[1]} << 16) | (uint32_t{u[2]} << 8) | u[3];
}

}  // namespace

namespace testing {
uint64_t ServicePollCalls() { return g_poll_calls; }
size_t ServiceBufferedBytes() {
  size_t n = 0;
  for (const auto& c : Watched()) n += c->reader_.capacity();
  return n;
}
}  // namespace testing

void ServiceFrameReader::Append(std::string_view bytes) {
  // Drop what was handed out before growing, so the buffer holds at most the
  // unfinished frame and this chunk.
  if (start_ > 0) {
    buffer_.erase(0, start_);
    start_ = 0;
  }
  buffer_.append(bytes);
}

ServiceFrameReader::Result ServiceFrameReader::Next(cf::Value* message, std::string* error) {
  const size_t waiting = buffer_.size() - start_;
  if (waiting >= 4) {
    const uint32_t length = BigEndian32(buffer_.data() + start_);
    if (length > kMaxServiceFrame) {
      if (error) *error = cf::Format("Service message of %u bytes is over the limit of %u", length,
                                     static_cast<uint32_t>(kMaxServiceFrame));
      return Result::kBad;
    }
    if (waiting - 4 >= length) {
      std::string reason;
      *message = DecodeServiceMessage(std::string_view(buffer_).substr(start_ + 4, length), &reason);
      start_ += 4 + size_t{length};
      if (message->IsNull()) {
        if (error) *error = "Bad service message (" + reason + ")";
        return Result::kBad;
      }
      return Result::kMessage;
    }
  }
  // Waiting for more: keep only the unfinished bytes, and give back the room
  // a large frame left behind, so an idle peer holds next to nothing.
  if (start_ > 0) {
    buffer_.erase(0, start_);
    start_ = 0;
  }
  if (buffer_.capacity() > 4096 && buffer_.capacity() > 2 * buffer_.size()) buffer_.shrink_to_fit();
  return Result::kNeedMore;
}

XPCConnection::XPCConnection(int fd, bool listener, std::string path)
    : fd_(fd), listener_(listener), path_(std::move(path)) {
  if (!listener_ && fd_ >= 0) ++g_open_peers;
}

void XPCConnection::Close() {
  if (fd_ < 0) return;
  close(fd_);
  fd_ = -1;
  if (!listener_) {
    --g_open_peers;
    HoldReserveDescriptor();
  }
  // Remove the socket only while it is still ours: another instance may
  // have replaced it meanwhile.
  struct stat st;
  if (listener_ && !path_.empty() && lstat(path_.c_str(), &st) == 0 && st.st_dev == socket_device_ &&
      st.st_ino == socket_inode_)
    unlink(path_.c_str());
}

bool XPCConnection::OnReady() {
  auto self = shared_from_this();  // a handler may cancel us
  if (listener_) {
    int peer = accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
    if (peer < 0 && (errno == EMFILE || errno == ENFILE) && g_reserve_fd >= 0) {
      close(g_reserve_fd);
      g_reserve_fd = -1;
      peer = accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
      if (peer >= 0) LogDefault("Out of file descriptors: a service connection took the one held in reserve");
    }
    if (peer < 0) {
      if (errno == EINTR || errno == EAGAIN || errno == ECONNABORTED) return false;
      if (!accept_failing_)
        LogError("Cannot accept a service connection (%s); pausing the listener", std::strerror(errno));
      accept_failing_ = true;
      paused_until_ = std::chrono::steady_clock::now() + kAcceptBackoff;
      return false;
    }
    accept_failing_ = false;
    Deliver(handler_, {XPCEvent::Type::kConnection, std::make_shared<XPCConnection>(peer, false, ""), {}});
    return true;
  }
  char chunk[65536];
  const ssize_t n = read(fd_, chunk, sizeof chunk);
  if (n < 0) {
    if (errno == EINTR || errno == EAGAIN) return false;
  }
  if (n <= 0) {
    if (reader_.mid_frame()) LogError("Service peer closed the connection in the middle of a message");
    Close();
    Unwatch(this);
    Deliver(handler_, {XPCEvent::Type::kError, nullptr, {}});
    return true;
  }
  reader_.Append(std::string_view(chunk, static_cast<size_t>(n)));
  bool delivered = false;
  // Hand over every complete frame; a bad one ends this connection.
  while (fd_ >= 0) {
    cf::Value message;
    std::string error;
    const ServiceFrameReader::Result result = reader_.Next(&message, &error);
    if (result == ServiceFrameReader::Result::kNeedMore) break;
    if (result == ServiceFrameReader::Result::kBad) {
      LogError("%s; closing the connection", error);
      Close();
      Unwatch(this);
      return delivered;
    }
    Deliver(handler_, {XPCEvent::Type::kDictionary, nullptr, std::move(message)});
    delivered = true;
  }
  return delivered;
}

bool ServiceSocketHandedOver() { return TakeHandedOver().announced; }

std::string ServiceSocketPath(std::string_view service_name) {
  return Context::Current().Path("/var/run/" + std::string(service_name) + ".sock");
}

bool EncodeServiceFrame(const cf::Value& message, std::string* frame, std::string* error) {
  std::string body;
  if (!cf::WriteBinaryPropertyList(message, body, error)) return false;
  if (body.size() > kMaxServiceFrame) {
    if (error) *error = "message is larger than 1 MiB";
    return false;
  }
  const uint32_t n = static_cast<uint32_t>(body.size());
  frame->assign({static_cast<char>(n >> 24), static_cast<char>(n >> 16), static_cast<char>(n >> 8), static_cast<char>(n)});
  frame->append(body);
  return true;
}

cf::Value DecodeServiceMessage(std::string_view body, std::string* error) {
  cf::ParseResult parsed = cf::ParsePropertyList(body);
  if (!parsed.ok()) {
    if (error) *error = parsed.error;
    return {};
  }
  if (!parsed.value.AsDictionary()) {
    if (error) *error = cf::TypeNameWithArticle(parsed.value.type()) + ", not a dictionary";
    return {};
  }
  return parsed.value;
}

bool SendServiceMessage(std::string_view service_name, const cf::Value& message, std::string* error) {
  const std::string path = ServiceSocketPath(service_name);
  std::string frame;
  if (!EncodeServiceFrame(message, &frame, error)) return false;
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  if (path.size() >= sizeof addr.sun_path) {
    if (error) *error = "socket path too long: " + path;
    return false;
  }
  std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0 || connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
    if (error) *error = "no service listening at " + path + " (" + std::strerror(errno) + ")";
    if (fd >= 0) close(fd);
    return false;
  }
  size_t done = 0;
  while (done < frame.size()) {
    const ssize_t n = send(fd, frame.data() + done, frame.size() - done, MSG_NOSIGNAL);
    if (n < 0) {
      if (errno == EINTR) continue;
      if (error) *error = std::string("cannot send: ") + std::strerror(errno);
      close(fd);
      return false;
    }
    done += static_cast<size_t>(n);
  }
  close(fd);
  return true;
}

}  // namespace platform

using namespace platform;

namespace {

// Makes way for the listener: true when nothing is at path or only a socket
// that nobody answers (left by a run that died), which is removed. A live
// socket belongs to another instance, and anything else is not ours to
// delete; both are reported and left alone.
bool ClearSocketPath(const std::string& path, const sockaddr_un& addr) {
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) {
    if (errno == ENOENT) return true;
    LogError("Cannot inspect %s: %s", path, std::strerror(errno));
    return false;
  }
  if (!S_ISSOCK(st.st_mode)) {
    LogError("%s is not a socket; leaving it alone and not serving", path);
    return false;
  }
  const int probe = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  if (probe < 0) {
    LogError("Cannot create the service socket: %s", std::strerror(errno));
    return false;
  }
  const int connected = connect(probe, reinterpret_cast<const sockaddr*>(&addr), sizeof addr);
  const int connect_error = errno;
  close(probe);
  // A full backlog (EAGAIN) is a live listener too.
  if (connected == 0 || connect_error == EAGAIN || connect_error == EINPROGRESS) {
    LogError("Another instance serves %s; not taking it over", path);
    return false;
  }
  if (connect_error != ECONNREFUSED) {
    LogError("Cannot tell whether %s is in use (%s); leaving it alone", path, std::strerror(connect_error));
    return false;
  }
  if (unlink(path.c_str()) != 0 && errno != ENOENT) {
    LogError("Cannot remove the stale socket %s: %s", path, std::strerror(errno));
    return false;
  }
  LogInfo("Removed the stale socket %s", path);
  return true;
}

// The listener on the socket the service manager handed over, once it is
// the one this service's peers reach. Its path stays empty: the manager
// made the socket file and removes it, not us.
xpc_connection_t AdoptHandedOverSocket(const std::string& path) {
  const auto refuse = [](const HandedOver& h, const std::string& why) -> xpc_connection_t {
    LogError("Not serving the socket handed over at start: %s", why);
    for (int i = 0; i < h.count; ++i) close(SD_LISTEN_FDS_START + i);
    return nullptr;
  };
  const HandedOver& h = TakeHandedOver();
  if (h.error != 0) return refuse(h, std::string("the announcement is broken (") + std::strerror(h.error) + ")");
  if (h.count != 1) return refuse(h, cf::Format("%d sockets were handed over, not one", h.count));
  const int fd = SD_LISTEN_FDS_START;
  if (sd_is_socket_unix(fd, SOCK_STREAM, 1, nullptr, 0) <= 0)
    return refuse(h, "it is not a listening Unix stream socket");
  if (sd_is_socket_unix(fd, SOCK_STREAM, 1, path.c_str(), 0) <= 0) return refuse(h, "it is not bound to " + path);
  // The run loop polls before it accepts; a peer that gives up in between
  // must not leave accept blocking.
  const int fl = fcntl(fd, F_GETFL);
  if (fl < 0 || fcntl(fd, F_SETFL, fl | O_NONBLOCK) != 0)
    return refuse(h, std::string("cannot make it non-blocking (") + std::strerror(errno) + ")");
  LogDebug("Serving the socket handed over at start (%s)", path);
  return std::make_shared<XPCConnection>(fd, true, "");
}

}  // namespace

xpc_connection_t xpc_connection_create_mach_service(std::string_view name, uint64_t flags) {
  if (!(flags & XPC_CONNECTION_MACH_SERVICE_LISTENER)) {
    LogError("Only listeners can be created for %s", std::string(name));
    return nullptr;
  }
  const std::string path = ServiceSocketPath(name);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  if (path.size() >= sizeof addr.sun_path) {
    LogError("Service socket path too long: %s", path);
    return nullptr;
  }
  std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
  if (ServiceSocketHandedOver()) return AdoptHandedOverSocket(path);
  const size_t slash = path.find_last_of('/');
  if (!MakeDirectories(path.substr(0, slash))) {
    LogError("Cannot create the directory of %s: %s", path, std::strerror(errno));
    return nullptr;
  }
  if (!ClearSocketPath(path, addr)) return nullptr;
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  if (fd < 0) {
    LogError("Cannot create the service socket: %s", std::strerror(errno));
    return nullptr;
  }
  // Bind under a strict umask so the socket is 0600 from its first moment.
  const mode_t old_mask = umask(0177);
  const int bound = bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
  umask(old_mask);
  struct stat st;
  if (bound != 0 || listen(fd, 16) != 0 || lstat(path.c_str(), &st) != 0) {
    LogError("Cannot listen on %s: %s", path, std::strerror(errno));
    close(fd);
    return nullptr;
  }
  auto listener = std::make_shared<XPCConnection>(fd, true, path);
  listener->socket_device_ = st.st_dev;
  listener->socket_inode_ = st.st_ino;
  return listener;
}

void xpc_connection_set_event_handler(const xpc_connection_t& connection, xpc_handler_t handler) {
  if (connection) connection->handler_ = std::move(handler);
}

void xpc_connection_set_target_queue(const xpc_connection_t&) {}

void xpc_connection_resume(const xpc_connection_t& connection) {
  if (!connection || connection->resumed_ || connection->fd_ < 0) return;
  connection->resumed_ = true;
  if (connection->listener_) HoldReserveDescriptor();
  Watched().push_back(connection);
}

void xpc_connection_cancel(const xpc_connection_t& connection) {
  if (!connection) return;
  connection->Close();
  Unwatch(connection.get());
}

int32_t CFRunLoopRunInMode(double seconds, bool returnAfterSourceHandled) {
  using Clock = std::chrono::steady_clock;
  const auto deadline = Clock::now() + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(seconds));
  for (;;) {
    const auto now = Clock::now();
    if (now >= deadline) {
      // A peer waiting on a paused listener is tried once more before the
      // wait ends, as the service may be about to leave.
      for (const auto& c : std::vector<xpc_connection_t>(Watched())) {
        if (!c->listener_ || c->fd_ < 0 || c->paused_until_ <= now || g_open_peers >= kMaxServiceConnections)
          continue;
        pollfd waiting{c->fd_, POLLIN, 0};
        if (poll(&waiting, 1, 0) == 1 && c->OnReady()) return kCFRunLoopRunHandledSource;
      }
      return kCFRunLoopRunTimedOut;
    }
    std::vector<xpc_connection_t> sources = Watched();
    if (sources.empty()) {
      // The main queue is always a source of the main run loop, so an empty
      // loop still waits out its time rather than finishing at once.
      std::this_thread::sleep_for(deadline - now);
      return kCFRunLoopRunTimedOut;
    }
    // A listener at the connection cap, or paused after a failed accept, is
    // left out (fd -1) so that its pending peers do not wake the loop.
    auto wake = deadline;
    std::vector<pollfd> fds;
    for (const auto& c : sources) {
      int fd = c->fd_;
      if (c->listener_) {
        if (g_open_peers >= kMaxServiceConnections) {
          fd = -1;
        } else if (c->paused_until_ > now) {
          fd = -1;
          wake = std::min(wake, c->paused_until_);
        }
      }
      fds.push_back({fd, POLLIN, 0});
    }
    const int wait_ms = static_cast<int>(std::chrono::duration_cast<std::chrono::milliseconds>(wake - now).count()) + 1;
    ++g_poll_calls;
    const int ready = poll(fds.data(), fds.size(), wait_ms);
    if (ready < 0 && errno != EINTR) return kCFRunLoopRunStopped;
    bool handled = false;
    for (size_t i = 0; ready > 0 && i < fds.size(); ++i)
      if (fds[i].fd >= 0 && fds[i].revents && sources[i]->fd_ >= 0) handled |= sources[i]->OnReady();
    if (handled && returnAfterSourceHandled) return kCFRunLoopRunHandledSource;
  }
}

int64_t xpc_dictionary_get_int64(const cf::Value& message, std::string_view key) {
  const cf::Dictionary* d = message.AsDictionary();
  if (!d) return 0;
  const cf::Value* v = d->Find(std::string(key));
  if (!v || !v->AsNumber()) return 0;
  return v->AsNumber()->AsSInt64();
}

const cf::String* xpc_dictionary_get_string(const cf::Value& message, std::string_view key) {
  const cf::Dictionary* d = message.AsDictionary();
  if (!d) return nullptr;
  const cf::Value* v = d->Find(std::string(key));
  return v ? v->AsString() : nullptr;
}

std::optional<std::array<uint8_t, 16>> xpc_dictionary_get_uuid(const cf::Value& message, std::string_view key) {
  const cf::Dictionary* d = message.AsDictionary();
  if (!d) return std::nullopt;
  const cf::Value* v = d->Find(std::string(key));
  if (!v || !v->AsData() || v->AsData()->size() != 16) return std::nullopt;
  std::array<uint8_t, 16> out;
  std::memcpy(out.data(), v->AsData()->data(), 16);
  return out;
}

cf::Value xpc_dictionary_get_value(const cf::Value& message, std::string_view key) {
  const cf::Dictionary* d = message.AsDictionary();
  return d ? d->Get(std::string(key)) : cf::Value();
}

std::string uuid_unparse(const std::array<uint8_t, 16>& uuid) {
  static const char* kHex = "0123456789ABCDEF";
  std::string out;
  for (size_t i = 0; i < 16; ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) out += '-';
    out += kHex[uuid[i] >> 4];
    out += kHex[uuid[i] & 15];
  }
  return out;
}

std::optional<std::array<uint8_t, 16>> uuid_parse(std::string_view text) {
  if (text.size() != 36) return std::nullopt;
  std::array<uint8_t, 16> out{};
  size_t byte = 0;
  for (size_t i = 0; i < 36;) {
    if (i == 8 || i == 13 || i == 18 || i == 23) {
      if (text[i] != '-') return std::nullopt;
      ++i;
      continue;
    }
    int v = 0;
    for (int k = 0; k < 2; ++k, ++i) {
      const char c = text[i];
      const int d = c >= '0' && c <= '9' ? c - '0' : c >= 'a' && c <= 'f' ? c - 'a' + 10 : c >= 'A' && c <= 'F' ? c - 'A' + 10 : -1;
      if (d < 0) return std::nullopt;
      v = v * 16 + d;
    }
    out[byte++] = static_cast<uint8_t>(v);
  }
  return out;
}
