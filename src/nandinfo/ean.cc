// The image driver's client: every query finds the driver, opens it, asks
// one scalar question and gives everything back, so nothing is held
// between queries.
#include <string>

#include "cf/format.h"
#include "nandinfo/helpers.h"
#include "nandinfo/views.h"
#include "platform/iokit.h"

namespace {

constexpr const char* kEANClass = "VelmoraNVMeEAN";
constexpr uint32_t kImageSizeMethod = 3;
constexpr uint32_t kUpdateCountMethod = 7;

// The key's four characters, most significant byte first, for %c%c%c%c.
unsigned char KeyChar(uint32_t key, int i) { return static_cast<unsigned char>(key >> (24 - 8 * i)); }

void Release(const EANConnection& c) {
  if (c.connection) IOServiceClose(c.connection);
  if (c.service) IOObjectRelease(c.service);
}

struct Query {
  const char* caller;  // the name in the connection failure
  const char* method;  // the name in the call failure
  uint32_t selector;
};

uint64_t Ask(const Query& q, uint32_t key) {
  EANConnection c;
  uint64_t output = 0;
  uint32_t output_count = 1;
  const int k0 = KeyChar(key, 0), k1 = KeyChar(key, 1), k2 = KeyChar(key, 2), k3 = KeyChar(key, 3);
  if (!getEANConnection(&c)) {
    SayNANDInfoF("%s: Unable to get EAN Io service connection for key (%u): %c%c%c%c", q.caller, key, k0, k1, k2, k3);
    Release(c);  // a service that could not be opened is still ours
    return 0;
  }
  const uint64_t input = key;
  uint64_t answer = 0;
  const kern_return_t rc =
      IOConnectCallMethod(c.connection, q.selector, &input, 1, nullptr, 0, &output, &output_count, nullptr, nullptr);
  if (rc != kIOReturnSuccess)
    SayNANDInfoF("%s: IOConnectCallMethod failed (key (%u): %c%c%c%c) kernResult:%x", q.method, key, k0, k1, k2, k3,
        static_cast<uint32_t>(rc));
  else
    answer = output;
  Release(c);
  return answer;
}

}  // namespace

// On failure the pair still holds the service when one was found; the
// caller releases it.
bool getEANConnection(EANConnection* c) {
  c->service = IOServiceGetMatchingService(kIOMainPortDefault, IOServiceMatching(kEANClass));
  if (!c->service) {
    SayNANDInfoF("getEANConnection: Couldn't find %s object", kEANClass);
    return false;
  }
  const kern_return_t rc = IOServiceOpen(c->service, mach_task_self(), 0, &c->connection);
  if (rc != kIOReturnSuccess) {
    c->connection = 0;
    SayNANDInfoF("getEANConnection: IOServiceOpen on %s failed kernResult:%x", kEANClass, static_cast<uint32_t>(rc));
    return false;
  }
  return true;
}

uint64_t GetEANImageSize(uint32_t key) { return Ask({"GetEANImageSize", "GetImageSize", kImageSizeMethod}, key); }

uint64_t GetEANUpdateCount(uint32_t key) {
  return Ask({"GetEANUpdateCount", "GetUpdateCount", kUpdateCountMethod}, key);
}
