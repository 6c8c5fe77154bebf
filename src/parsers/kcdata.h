// The search of a kcdata stackshot for one thread's I/O statistics, which
// the memory freezer's write count comes from. Pure: it reads the caller's
// bytes and nothing else, and no input makes it read outside [start, end).
#pragma once

#include <cstdint>

// Keys of the freezer statistics in the NAND info dictionaries.
inline constexpr const char* kNANDInfoVMFreezerNumPhysicalWritesKey =
    "com.velmora.NANDInfo.VMFreezer.NumPhysicalWrites";
inline constexpr const char* kNANDInfoVMFreezerErrorKey = "com.velmora.NANDInfo.VMFreezer.Error";
inline constexpr const char* kNANDInfoVMFreezerErrorMessageKey = "com.velmora.NANDInfo.VMFreezer.ErrorMessage";

// The kernel thread through which the freezer writes to storage.
inline constexpr const char* kVMFreezerThreadName = "VM_swapout";

// Item types. Every item is a 16-byte header (u32 type, u32 payload size,
// u64 flags) followed by its payload; all little-endian.
inline constexpr uint32_t KCDATA_TYPE_BUFFER_END = 0xF19158ED;
// Counted as a container only with a payload of at least 4 bytes; the
// container id is the flags field of both the begin and its end.
inline constexpr uint32_t KCDATA_TYPE_CONTAINER_BEGIN = 0x13;
inline constexpr uint32_t KCDATA_TYPE_CONTAINER_END = 0x14;
// Arrays (0x20 to 0x2F): passed over by their size like any other item.
inline constexpr uint32_t KCDATA_TYPE_ARRAY_PAD0 = 0x20;
inline constexpr uint32_t KCDATA_TYPE_ARRAY_PADF = 0x2F;
// A NUL-padded thread name.
inline constexpr uint32_t STACKSHOT_KCTYPE_THREAD_NAME = 0x909;
// I/O statistics: u64 fields, the fourth of which is the bytes written to disk.
inline constexpr uint32_t STACKSHOT_KCTYPE_IOSTATS = 0x901;

inline constexpr uint32_t kKCDataItemHeaderSize = 16;
// How deep containers are searched, the first top-level one counting as 1.
// A begin any deeper is treated like the end of the buffer: 1 MiB could
// otherwise hold some 65,000 nested begins and recurse as deep.
inline constexpr int kKCDataMaxContainerDepth = 64;

// Where a search stopped: behind the searched container's end item when it
// ended normally, else at the item that stopped it. end is the search's end.
struct KCDataCursor {
  const void* position = nullptr;
  const void* end = nullptr;
};

// Searches the first container (begin item with a payload of at least 4
// bytes) found from start, and the containers inside it, for a container
// holding a thread-name item equal to threadName in the name item's first
// min(size, 64) characters (strncmp: an empty name item matches any name).
// On a match returns 1 and sets *ioStats (when ioStats is not null) to that
// container's own I/O-statistics payload, or to null when it has none;
// otherwise returns 0 and leaves *ioStats alone. A truncated item, an
// end-of-buffer item or nesting deeper than kKCDataMaxContainerDepth ends
// the walk; the containers read up to there are still matched. *cursor,
// when given, receives where the search stopped.
int getIOStatsWithThreadnameFromKCDataHelper(const void* start, const void* end, const char* threadName,
                                             const void** ioStats, KCDataCursor* cursor);

// The helper without a cursor.
int getIOStatsWithThreadnameFromKCData(const void* start, const void* end, const char* threadName,
                                       const void** ioStats);

// The bytes written to disk from an I/O-statistics pointer the search set:
// the fourth little-endian u64 of the payload; 0 for null or a payload
// shorter than 32 bytes. It reads the item header just before ioStats, so
// it takes only pointers the search returned.
uint64_t KCDataDiskWriteBytes(const void* ioStats);
