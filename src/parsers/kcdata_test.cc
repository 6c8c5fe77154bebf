#include "parsers/kcdata.h"

#include <gtest/gtest.h>

#include <cstring>
#include <memory>
#include <string>

#include "sim/kcdata.h"

namespace {

using sim::KCDataBuilder;

struct Result {
  int found = 0;
  const uint8_t* stats = nullptr;
  uint64_t writes = 0;
  size_t cursor = 0;  // offset of the cursor from the start
};

// Searches a copy of the bytes in a buffer of exactly their size, placed
// `shift` bytes into an allocation, so that the sanitizers see any read past
// the end and unaligned headers get read.
class Buffer {
 public:
  explicit Buffer(const std::string& bytes, size_t shift = 0)
      : storage_(new uint8_t[bytes.size() + shift]), start_(storage_.get() + shift), size_(bytes.size()) {
    if (!bytes.empty()) std::memcpy(start_, bytes.data(), bytes.size());
  }
  Result Search(const char* name = kVMFreezerThreadName) const {
    Result r;
    const void* stats = reinterpret_cast<const void*>(1);  // untouched unless found
    KCDataCursor cursor;
    r.found = getIOStatsWithThreadnameFromKCDataHelper(start_, start_ + size_, name, &stats, &cursor);
    EXPECT_EQ(cursor.end, start_ + size_);
    const auto* at = static_cast<const uint8_t*>(cursor.position);
    EXPECT_TRUE(at >= start_ && at <= start_ + size_);
    r.cursor = static_cast<size_t>(at - start_);
    if (!r.found) {
      EXPECT_EQ(stats, reinterpret_cast<const void*>(1));
      return r;
    }
    r.stats = static_cast<const uint8_t*>(stats);
    if (r.stats) {
      EXPECT_TRUE(r.stats >= start_ + 16 && r.stats <= start_ + size_);
      r.writes = KCDataDiskWriteBytes(r.stats);
    }
    // The wrapper agrees with the helper.
    const void* again = nullptr;
    EXPECT_EQ(getIOStatsWithThreadnameFromKCData(start_, start_ + size_, name, &again), 1);
    EXPECT_EQ(again, stats);
    return r;
  }
  const uint8_t* start() const { return start_; }

 private:
  std::unique_ptr<uint8_t[]> storage_;
  uint8_t* start_;
  size_t size_;
};

Result Search(const KCDataBuilder& b, const char* name = kVMFreezerThreadName) { return Buffer(b.bytes()).Search(name); }

TEST(KCDataSearchTest, FreezerCases) {
  struct Case {
    const char* what;
    KCDataBuilder buffer;
    int found;
    bool has_stats;
    uint64_t writes;
  };
  Case cases[] = {
      {"thread with 4096 bytes written",
       KCDataBuilder().Begin(1).Begin(2).TaskName("kernel_task").Begin(3).ThreadName("VM_swapout").IOStats(4096)
           .End(3).End(2).End(1).BufferEnd(),
       1, true, 4096},
      {"matching thread without I/O statistics",
       KCDataBuilder().Begin(1).Begin(2).Begin(3).ThreadName("VM_swapout").End(3).End(2).End(1).BufferEnd(), 1,
       false, 0},
      {"thread only in a second top-level container",
       KCDataBuilder().Begin(1).Begin(3).ThreadName("other").IOStats(1).End(3).End(1).Begin(2).Begin(4)
           .ThreadName("VM_swapout").IOStats(4096).End(4).End(2).BufferEnd(),
       0, false, 0},
      {"two-byte name item \"VM\"",
       KCDataBuilder().Begin(1).Begin(3).ThreadName("VM", 2).IOStats(77).End(3).End(1).BufferEnd(), 1, true, 77},
      {"the task's statistics are not the thread's",
       KCDataBuilder().Begin(1).Begin(2).IOStats(999).Begin(3).ThreadName("VM_swapout").End(3).IOStats(998).End(2)
           .End(1).BufferEnd(),
       1, false, 0},
      {"the thread's own statistics, not its task's before them",
       KCDataBuilder().Begin(1).Begin(2).IOStats(999).Begin(3).IOStats(5).ThreadName("VM_swapout").End(3).End(2)
           .End(1),
       1, true, 5},
      {"the fourth field, whatever the others hold",
       KCDataBuilder().Begin(1).ThreadName("VM_swapout").IOStatsFields({11, 22, 33, 44, 55}).End(1), 1, true, 44},
      {"statistics shorter than four fields count as 0",
       KCDataBuilder().Begin(1).ThreadName("VM_swapout").IOStatsFields({11, 22, 33}).End(1), 1, true, 0},
      {"the last statistics item of a container wins",
       KCDataBuilder().Begin(1).IOStats(1).ThreadName("VM_swapout").IOStats(2).End(1), 1, true, 2},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    const Result r = Search(c.buffer);
    EXPECT_EQ(r.found, c.found);
    EXPECT_EQ(r.stats != nullptr, c.has_stats);
    EXPECT_EQ(r.writes, c.writes);
  }
  EXPECT_EQ(KCDataDiskWriteBytes(nullptr), 0u);
}

TEST(KCDataSearchTest, NameComparison) {
  const std::string long_name(70, 'a');
  struct Case {
    std::string stored;  // the name item's payload, as is
    const char* sought;
    int found;
  };
  const Case cases[] = {
      {std::string("VM_swapout") + std::string(54, '\0'), "VM_swapout", 1},
      {"VM_swapout", "VM_swapout", 1},   // no NUL in the item: its size bounds the comparison
      {"VM_swap", "VM_swapout", 1},      // only as many characters as the item holds
      {"", "VM_swapout", 1},             // an empty name item compares nothing
      {"VM_swapouts", "VM_swapout", 0},
      {std::string("VM_swapoutX\0", 12), "VM_swapout", 0},
      {std::string("vm_swapout\0", 11), "VM_swapout", 0},
      {std::string("VM_swapout\0", 11), "VM_swapout_long", 0},
      {std::string("VM_sw\0pout", 10), "VM_sw", 1},  // strncmp stops at the NUL
      {std::string(80, 'a'), long_name.c_str(), 1},    // at most 64 characters compared
      {std::string(64, 'a') + "b", long_name.c_str(), 1},
      {std::string(63, 'a') + "b", long_name.c_str(), 0},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.stored + " / " + c.sought);
    KCDataBuilder b;
    b.Begin(1).Item(STACKSHOT_KCTYPE_THREAD_NAME, c.stored).IOStats(3).End(1);
    const Result r = Search(b, c.sought);
    EXPECT_EQ(r.found, c.found);
    EXPECT_EQ(r.writes, c.found ? 3u : 0u);
  }
  // The last name item of a container is the one compared.
  KCDataBuilder later;
  later.Begin(1).ThreadName("other").ThreadName("VM_swapout").End(1);
  EXPECT_EQ(Search(later).found, 1);
  KCDataBuilder earlier;
  earlier.Begin(1).ThreadName("VM_swapout").ThreadName("other").End(1);
  EXPECT_EQ(Search(earlier).found, 0);
  // A task-name item is not a thread name.
  KCDataBuilder task;
  task.Begin(1).TaskName("VM_swapout").End(1);
  EXPECT_EQ(Search(task).found, 0);
  // No name to look for.
  const std::string bytes = later.bytes();
  const void* stats = nullptr;
  EXPECT_EQ(getIOStatsWithThreadnameFromKCData(bytes.data(), bytes.data() + bytes.size(), nullptr, &stats), 0);
}

TEST(KCDataSearchTest, ItemWalkAndCursor) {
  // Items before the first container are passed over, arrays whole: a
  // matching thread inside an array's payload is never seen.
  for (uint32_t type = KCDATA_TYPE_ARRAY_PAD0; type <= KCDATA_TYPE_ARRAY_PADF; ++type) {
    SCOPED_TRACE(type);
    const std::string hidden = KCDataBuilder().Begin(9).ThreadName("VM_swapout").End(9).bytes();
    KCDataBuilder top;
    top.Item(0x77, "x").Item(type, hidden).Begin(1).ThreadName("other").End(1);
    EXPECT_EQ(Search(top).found, 0);
    KCDataBuilder inside;
    inside.Begin(1).Item(type, hidden).End(1);
    EXPECT_EQ(Search(inside).found, 0);
  }
  // A begin with fewer than 4 payload bytes is no container, at the top or inside.
  KCDataBuilder short_top;
  short_top.Item(KCDATA_TYPE_CONTAINER_BEGIN, "abc", 5).ThreadName("VM_swapout").End(5).Begin(1).End(1).BufferEnd();
  EXPECT_EQ(Search(short_top).found, 0);
  KCDataBuilder short_inside;
  short_inside.Begin(1).ThreadName("other").Item(KCDATA_TYPE_CONTAINER_BEGIN, "ab", 7).ThreadName("VM_swapout")
      .End(7).End(1);
  EXPECT_EQ(Search(short_inside).found, 1);  // the name is container 1's, and End(7) ends nothing

  // Only the end with the begin's 64-bit id closes a container.
  KCDataBuilder ids;
  ids.Begin(1).Begin(2).End(1 + (1ull << 32)).End(1).ThreadName("VM_swapout").End(2).End(1);
  EXPECT_EQ(Search(ids).found, 1);

  // An end-of-buffer item ends everything, before or inside the container.
  KCDataBuilder end_first;
  end_first.BufferEnd().Begin(1).ThreadName("VM_swapout").End(1);
  EXPECT_EQ(Search(end_first).found, 0);
  EXPECT_EQ(Search(end_first).cursor, 0u);
  KCDataBuilder end_nested;
  end_nested.Begin(1).Begin(2).BufferEnd().ThreadName("VM_swapout").End(2).End(1);
  const Result r = Search(end_nested);
  EXPECT_EQ(r.found, 0);
  EXPECT_EQ(r.cursor, 40u);  // at the end-of-buffer item, behind two 20-byte begins

  // The cursor stops behind the searched container, so a caller can go on
  // with the next top-level one.
  KCDataBuilder two;
  two.Begin(1).Begin(3).ThreadName("other").End(3).End(1);
  const size_t first = two.size();
  two.Begin(2).Begin(4).ThreadName("VM_swapout").IOStats(12).End(4).End(2).BufferEnd();
  const Buffer buffer(two.bytes());
  const Result none = buffer.Search();
  EXPECT_EQ(none.found, 0);
  EXPECT_EQ(none.cursor, first);
  const void* stats = nullptr;
  KCDataCursor cursor;
  EXPECT_EQ(getIOStatsWithThreadnameFromKCDataHelper(buffer.start() + none.cursor, buffer.start() + two.size(),
                                                     "VM_swapout", &stats, &cursor),
            1);
  EXPECT_EQ(KCDataDiskWriteBytes(stats), 12u);
  // On a find, the cursor is behind the thread's container.
  EXPECT_EQ(static_cast<const uint8_t*>(cursor.position), buffer.start() + two.size() - 16 - 16);

  // Null or reversed bounds.
  EXPECT_EQ(getIOStatsWithThreadnameFromKCData(nullptr, nullptr, "VM_swapout", &stats), 0);
  EXPECT_EQ(getIOStatsWithThreadnameFromKCData(buffer.start() + 8, buffer.start(), "VM_swapout", &stats), 0);
  EXPECT_EQ(getIOStatsWithThreadnameFromKCDataHelper(buffer.start(), buffer.start() + 15, "VM_swapout", &stats,
                                                     nullptr),
            0);
}

TEST(KCDataSearchTest, EveryTruncation) {
  // Tasks before and after, and the thread's name and statistics at known offsets.
  KCDataBuilder b;
  b.Begin(1, sim::kKCDataStackshotKind).Begin(2, sim::kKCDataTaskKind).TaskName("launchd").Begin(3)
      .ThreadName("main").IOStats(1).End(3).End(2).Begin(4, sim::kKCDataTaskKind).TaskName("kernel_task")
      .IOStats(7).Begin(5).ThreadName("VM_swapout");
  const size_t named = b.size();
  b.IOStats(4096);
  const size_t counted = b.size();
  b.End(5).Begin(6).ThreadName("idle").End(6).End(4).End(1).BufferEnd();
  const std::string whole = b.bytes();
  for (size_t shift : {0, 3}) {
    for (size_t n = 0; n <= whole.size(); ++n) {
      SCOPED_TRACE(testing::Message() << "shift " << shift << ", length " << n);
      const Result r = Buffer(whole.substr(0, n), shift).Search();
      // A cut walk still matches on what it read.
      EXPECT_EQ(r.found, n >= named ? 1 : 0);
      EXPECT_EQ(r.writes, n >= counted ? 4096u : 0u);
      EXPECT_EQ(r.stats != nullptr, n >= counted);
    }
  }
}

TEST(KCDataSearchTest, HostileSizesAndNesting) {
  // A size that would wrap the pointer: the walk stops, what came before counts.
  for (uint32_t size : {0xFFFFFFFFu, 0xFFFFFFF0u, 0xFFFFFFEFu, 0x80000000u}) {
    SCOPED_TRACE(size);
    KCDataBuilder top;
    top.Header(0x77, size).Begin(1).ThreadName("VM_swapout").End(1);
    EXPECT_EQ(Search(top).found, 0);
    EXPECT_EQ(Search(top).cursor, 0u);
    KCDataBuilder inside;
    inside.Begin(1).ThreadName("VM_swapout").Header(STACKSHOT_KCTYPE_IOSTATS, size).IOStats(5);
    const Result r = Search(inside);
    EXPECT_EQ(r.found, 1);
    EXPECT_EQ(r.stats, nullptr);
    EXPECT_EQ(r.cursor, 20u + 80u);  // at the bad header
    KCDataBuilder begin;
    begin.Begin(1).Header(KCDATA_TYPE_CONTAINER_BEGIN, size, 2).ThreadName("VM_swapout").End(2).End(1);
    EXPECT_EQ(Search(begin).found, 0);
  }
  // A payload that ends exactly at the end fits; one byte more does not.
  KCDataBuilder exact;
  exact.Begin(1).ThreadName("VM_swapout").Header(STACKSHOT_KCTYPE_IOSTATS, 32).Bytes(std::string(31, '\0') + "\x01");
  EXPECT_EQ(Search(exact).writes, 1ull << 56);
  KCDataBuilder over;
  over.Begin(1).ThreadName("VM_swapout").Header(STACKSHOT_KCTYPE_IOSTATS, 33).Bytes(std::string(32, '\1'));
  EXPECT_EQ(Search(over).stats, nullptr);

  // Containers that never end: the walk runs to the end of the buffer.
  KCDataBuilder open;
  open.Begin(1).Begin(2).ThreadName("other").Begin(3).ThreadName("VM_swapout").IOStats(8);
  EXPECT_EQ(Search(open).writes, 8u);
  KCDataBuilder open_none;
  open_none.Begin(1).Begin(2).ThreadName("other").Begin(3);
  EXPECT_EQ(Search(open_none).found, 0);
  EXPECT_EQ(Search(open_none).cursor, open_none.size());

  // Nesting: a thread at the depth cap is found, one level deeper is not.
  auto nested = [](int depth, bool closed) {
    KCDataBuilder b;
    for (int i = 1; i <= depth; ++i) b.Begin(static_cast<uint64_t>(i));
    b.ThreadName("VM_swapout").IOStats(64);
    if (closed)
      for (int i = depth; i >= 1; --i) b.End(static_cast<uint64_t>(i));
    return b;
  };
  EXPECT_EQ(Search(nested(kKCDataMaxContainerDepth, true)).writes, 64u);
  EXPECT_EQ(Search(nested(kKCDataMaxContainerDepth + 1, true)).found, 0);
  const Result deep = Search(nested(kKCDataMaxContainerDepth + 1, true));
  EXPECT_EQ(deep.cursor, 20u * kKCDataMaxContainerDepth);  // at the begin past the cap
  // A thread at the cap whose own container goes deeper still matches.
  KCDataBuilder at_cap = nested(kKCDataMaxContainerDepth, false);
  at_cap.Begin(999).End(999);
  EXPECT_EQ(Search(at_cap).writes, 64u);
  // A megabyte of begins costs neither stack nor time.
  const KCDataBuilder huge = nested(60000, false);
  ASSERT_GT(huge.size(), 1u << 20);
  EXPECT_EQ(Search(huge).found, 0);
}

}  // namespace
