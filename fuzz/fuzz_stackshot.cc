// The stackshot the simulated device makes from stackshot.plist: the
// description encoded to kcdata, then searched the way the freezer's write
// count is found. (Raw stackshot.kcdata bytes go to the search unchanged;
// fuzz_kcdata covers those.) What the description says must come back: a
// thread is found by its name exactly when the description has one so
// named, with the disk writes of the first one (0 when it has none).
#include <cstdint>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "cf/plist.h"
#include "parsers/kcdata.h"
#include "sim/kcdata.h"

namespace {

struct Thread {
  std::string name;
  uint64_t writes;
};

// The threads in the order the stackshot holds them. Only called on a
// description the encoder took, so its shape is known.
std::vector<Thread> Threads(const cf::Array& tasks) {
  std::vector<Thread> out;
  for (const cf::Value& task : tasks) {
    const cf::Array* threads = task.AsDictionary()->Get("threads").AsArray();
    if (!threads) continue;
    for (const cf::Value& thread : *threads) {
      const cf::Dictionary* d = thread.AsDictionary();
      const cf::Number* writes = d->Get("diskWrites").AsNumber();
      out.push_back({std::string(d->Get("name").StringView()), writes ? writes->AsUInt64() : 0});
    }
  }
  return out;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const cf::ParseResult parsed = cf::ParsePropertyList(std::string_view(reinterpret_cast<const char*>(data), size));
  if (!parsed.ok()) return 0;
  std::string error;
  const auto encoded = sim::EncodeKCDataStackshot(parsed.value, &error);
  if (!encoded) {
    if (error.empty()) __builtin_trap();  // a refusal says why
    return 0;
  }
  // An exact-size heap copy, so that a read past the end is caught.
  std::unique_ptr<uint8_t[]> buffer(new uint8_t[encoded->size()]);
  std::memcpy(buffer.get(), encoded->data(), encoded->size());
  const uint8_t* end = buffer.get() + encoded->size();

  const std::vector<Thread> threads = Threads(*parsed.value.AsArray());
  std::vector<std::string> names = {kVMFreezerThreadName, "VM_swapou", "VM_swapout_"};
  for (size_t i = 0; i < threads.size() && i < 8; ++i) names.push_back(threads[i].name);
  for (const std::string& name : names) {
    const Thread* first = nullptr;
    for (const Thread& t : threads)
      if (t.name == name) {
        first = &t;
        break;
      }
    const void* stats = nullptr;
    const int found = getIOStatsWithThreadnameFromKCData(buffer.get(), end, name.c_str(), &stats);
    if (found != (first != nullptr)) __builtin_trap();
    if (found && KCDataDiskWriteBytes(stats) != first->writes) __builtin_trap();
  }
  return 0;
}
