// The on-demand service: a listener on the Unix socket
// $ROOT/var/run/<service>.sock (mode 0600) and a run loop on the main thread.
//
// Messages travel as a 4-byte big-endian length and a binary property-list
// dictionary. Handlers run only inside CFRunLoopRunInMode, one at a time.
#pragma once

#include <array>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "cf/value.h"

namespace platform {

class XPCConnection;
using xpc_connection_t = std::shared_ptr<XPCConnection>;

struct XPCEvent {
  enum class Type { kConnection, kDictionary, kError };
  Type type;
  xpc_connection_t connection;  // kConnection: the new peer
  cf::Value message;            // kDictionary: the message
};
using xpc_handler_t = std::function<void(const XPCEvent&)>;

inline constexpr uint64_t XPC_CONNECTION_MACH_SERVICE_LISTENER = 1;
inline constexpr size_t kMaxServiceFrame = 1 << 20;
// Peers served at once. Beyond this the listener is not polled, so further
// peers wait in the kernel's backlog (their messages are not lost) until
// one of these closes.
inline constexpr size_t kMaxServiceConnections = 64;

// Run-loop results.
inline constexpr int32_t kCFRunLoopRunFinished = 1;
inline constexpr int32_t kCFRunLoopRunStopped = 2;
inline constexpr int32_t kCFRunLoopRunTimedOut = 3;
inline constexpr int32_t kCFRunLoopRunHandledSource = 4;

std::string ServiceSocketPath(std::string_view service_name);

// Whether the service manager that started this process handed it its
// listening socket (LISTEN_PID names this process and LISTEN_FDS is set).
// The answer is taken once, at the first call, and the variables are then
// cleared so that nothing this process starts mistakes them for its own.
// When true, xpc_connection_create_mach_service serves that socket: it
// neither binds nor removes the path, which belongs to the manager. A
// handed-over socket that cannot be served (more than one, not a listening
// Unix stream socket, bound elsewhere than the service's path) is refused
// with one error line, and the service listens on nothing: binding a second
// socket beside the manager's would leave peers talking to the wrong one.
bool ServiceSocketHandedOver();

// Sends one message to the service of the current root. False with a reason
// when there is no socket or the message cannot be sent.
bool SendServiceMessage(std::string_view service_name, const cf::Value& message, std::string* error);

// Frame helpers, shared by both ends and the fuzz target.
bool EncodeServiceFrame(const cf::Value& message, std::string* frame, std::string* error);
// Parses a frame body; a result that is not a dictionary gives an error.
cf::Value DecodeServiceMessage(std::string_view body, std::string* error);

// Cuts a connection's byte stream into messages. It holds only the bytes
// that arrived and are not yet handed out, whatever length a frame announces.
class ServiceFrameReader {
 public:
  enum class Result { kNeedMore, kMessage, kBad };
  void Append(std::string_view bytes);
  // The next complete message; kNeedMore until one is complete; kBad (the
  // reason in *error) for a frame over kMaxServiceFrame or a body that is no
  // dictionary, after which the stream cannot be trusted.
  Result Next(cf::Value* message, std::string* error);
  // Bytes of an unfinished frame are waiting.
  bool mid_frame() const { return buffer_.size() > start_; }
  size_t capacity() const { return buffer_.capacity(); }

 private:
  std::string buffer_;
  size_t start_ = 0;  // bytes at the front already handed out
};

namespace testing {
// How often the run loop has called poll, to see that it does not spin.
uint64_t ServicePollCalls();
// The bytes the connections' frame readers hold.
size_t ServiceBufferedBytes();
}  // namespace testing

}  // namespace platform

// Null when the socket cannot be created, or a handed-over one cannot be
// served (the reason goes to the log).
platform::xpc_connection_t xpc_connection_create_mach_service(std::string_view name, uint64_t flags);
void xpc_connection_set_event_handler(const platform::xpc_connection_t& connection, platform::xpc_handler_t handler);
// Every connection targets the main queue here; kept for the call sites.
void xpc_connection_set_target_queue(const platform::xpc_connection_t& connection);
void xpc_connection_resume(const platform::xpc_connection_t& connection);
void xpc_connection_cancel(const platform::xpc_connection_t& connection);

// Waits up to seconds for events and runs their handlers.
int32_t CFRunLoopRunInMode(double seconds, bool returnAfterSourceHandled);

// Message readers; a missing or mistyped int64 reads as 0.
int64_t xpc_dictionary_get_int64(const cf::Value& message, std::string_view key);
const cf::String* xpc_dictionary_get_string(const cf::Value& message, std::string_view key);
std::optional<std::array<uint8_t, 16>> xpc_dictionary_get_uuid(const cf::Value& message, std::string_view key);
cf::Value xpc_dictionary_get_value(const cf::Value& message, std::string_view key);
// The hyphenated 8-4-4-4-12 text of a UUID, in upper case.
std::string uuid_unparse(const std::array<uint8_t, 16>& uuid);
// Parses that text (either case); nothing for anything else.
std::optional<std::array<uint8_t, 16>> uuid_parse(std::string_view text);
