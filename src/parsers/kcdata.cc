#include "parsers/kcdata.h"

#include <cstddef>
#include <cstring>

namespace {

constexpr uint32_t kNameCompareMax = 64;
constexpr uint32_t kDiskWritesOffset = 24;  // fourth u64 of the I/O statistics

uint32_t Le32(const uint8_t* p) {
  return uint32_t{p[0]} | uint32_t{p[1]} << 8 | uint32_t{p[2]} << 16 | uint32_t{p[3]} << 24;
}

uint64_t Le64(const uint8_t* p) { return uint64_t{Le32(p)} | uint64_t{Le32(p + 4)} << 32; }

struct Item {
  uint32_t type;
  uint32_t size;
  uint64_t flags;
  const uint8_t* payload;
  const uint8_t* next;
};

enum class Read { kItem, kTruncated };

// The item at p, when its header and payload both end at or before end.
// Sizes are compared with what is left, so a size near 2^32 cannot wrap a
// pointer past end.
Read ReadItem(const uint8_t* p, const uint8_t* end, Item* item) {
  const size_t left = static_cast<size_t>(end - p);
  if (left < kKCDataItemHeaderSize) return Read::kTruncated;
  item->type = Le32(p);
  item->size = Le32(p + 4);
  item->flags = Le64(p + 8);
  if (item->size > left - kKCDataItemHeaderSize) return Read::kTruncated;
  item->payload = p + kKCDataItemHeaderSize;
  item->next = item->payload + item->size;
  return Read::kItem;
}

bool IsContainerBegin(const Item& item) { return item.type == KCDATA_TYPE_CONTAINER_BEGIN && item.size >= 4; }

enum class Walk {
  kFound,     // the thread is in this container or one inside it
  kNotFound,  // the container ended at its end item; *stop is behind it
  kStopped,   // truncation, end of buffer or too deep; *stop is at that item
};

// Walks the container whose begin item is `begin` (already read) up to its
// end item. The name and I/O-statistics pointers are this container's own,
// so an enclosing task's statistics never stand in for its thread's.
Walk WalkContainer(const Item& begin, const uint8_t* end, const char* name, const uint8_t** ioStats,
                   const uint8_t** stop, int depth) {
  const uint8_t* stored_name = nullptr;
  uint32_t compare = 0;
  const uint8_t* stats = nullptr;
  const uint8_t* p = begin.next;
  Walk result = Walk::kStopped;
  for (;;) {
    Item item;
    if (ReadItem(p, end, &item) == Read::kTruncated || item.type == KCDATA_TYPE_BUFFER_END) break;
    if (item.type == KCDATA_TYPE_CONTAINER_END && item.flags == begin.flags) {
      p = item.next;
      result = Walk::kNotFound;
      break;
    }
    if (IsContainerBegin(item)) {
      // Past the cap the nesting is hostile, not a stackshot: stop as if the
      // buffer ended here rather than recurse further.
      if (depth >= kKCDataMaxContainerDepth) break;
      const uint8_t* behind = nullptr;
      const Walk nested = WalkContainer(item, end, name, ioStats, &behind, depth + 1);
      p = behind;
      if (nested == Walk::kFound) {
        *stop = p;
        return Walk::kFound;
      }
      if (nested == Walk::kStopped) break;
      continue;
    }
    if (item.type == STACKSHOT_KCTYPE_THREAD_NAME) {
      stored_name = item.payload;
      compare = item.size < kNameCompareMax ? item.size : kNameCompareMax;
    } else if (item.type == STACKSHOT_KCTYPE_IOSTATS) {
      stats = item.payload;
    }
    p = item.next;
  }
  *stop = p;
  // A walk cut short still matches on what it read.
  if (stored_name && std::strncmp(name, reinterpret_cast<const char*>(stored_name), compare) == 0) {
    *ioStats = stats;
    return Walk::kFound;
  }
  return result;
}

}  // namespace

int getIOStatsWithThreadnameFromKCDataHelper(const void* start, const void* end, const char* threadName,
                                             const void** ioStats, KCDataCursor* cursor) {
  const auto* p = static_cast<const uint8_t*>(start);
  const auto* e = static_cast<const uint8_t*>(end);
  auto finish = [&](const uint8_t* at, int found) {
    if (cursor) *cursor = {at, end};
    return found;
  };
  if (!threadName || !p || !e || e < p) return finish(p, 0);
  // Only the first top-level container counts: the items before it are
  // passed over, and the containers after it belong to other tasks.
  Item item;
  for (;;) {
    if (ReadItem(p, e, &item) == Read::kTruncated || item.type == KCDATA_TYPE_BUFFER_END) return finish(p, 0);
    if (IsContainerBegin(item)) break;
    p = item.next;
  }
  const uint8_t* found = nullptr;
  const uint8_t* stop = nullptr;
  if (WalkContainer(item, e, threadName, &found, &stop, 1) != Walk::kFound) return finish(stop, 0);
  if (ioStats) *ioStats = found;
  return finish(stop, 1);
}

int getIOStatsWithThreadnameFromKCData(const void* start, const void* end, const char* threadName,
                                       const void** ioStats) {
  return getIOStatsWithThreadnameFromKCDataHelper(start, end, threadName, ioStats, nullptr);
}

uint64_t KCDataDiskWriteBytes(const void* ioStats) {
  if (!ioStats) return 0;
  const auto* payload = static_cast<const uint8_t*>(ioStats);
  const uint32_t size = Le32(payload - kKCDataItemHeaderSize + 4);
  if (size < kDiskWritesOffset + 8) return 0;
  return Le64(payload + kDiskWritesOffset);
}
