// Parser contexts: ordered (name, unsigned 64-bit value) pairs, the
// operations every statistics parser appends with, and the process-wide
// last-error message the parsers and the storage service report through.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "cf/format.h"
#include "cf/value.h"

// The characters of a context's names, written one after another into
// blocks that never move, so the views its pairs hold stay valid while it
// grows. Move-only: a copy's views would point into the original's blocks.
class ParserNameArena {
 public:
  ParserNameArena() = default;
  ParserNameArena(ParserNameArena&& other) noexcept;
  ParserNameArena& operator=(ParserNameArena&& other) noexcept;
  ParserNameArena(const ParserNameArena&) = delete;
  ParserNameArena& operator=(const ParserNameArena&) = delete;
  ~ParserNameArena() { Release(); }

  // At least n writable characters; throws std::bad_alloc. What is written
  // there belongs to the arena only once committed.
  char* Room(size_t n) { return left_ >= n ? cursor_ : NewBlock(n); }
  // The same, or null where that would take a new block.
  char* RoomAtHand(size_t n) const { return left_ >= n ? cursor_ : nullptr; }
  void Commit(size_t n) {
    cursor_ += n;
    left_ -= n;
  }
  // Where the arena stands, and a return there that frees what came after.
  struct Mark {
    const void* block;
    char* cursor;
    size_t left;
  };
  Mark Position() const { return {head_, cursor_, left_}; }
  void Rewind(const Mark& mark);
  void Release();

 private:
  struct Block;
  char* NewBlock(size_t n);

  Block* head_ = nullptr;  // the block being filled; each links to the one before
  char* cursor_ = nullptr;
  size_t left_ = 0;
  static constexpr size_t kFirstBlockSize = 4096;
  size_t next_block_size_ = kFirstBlockSize;
};

// One pair (name, value). Names are at most 98 characters and live in the
// context's name arena; names repeat when a key occurs twice in a buffer.
// The dictionary's own pair type, so a context's pairs build one as they are.
using ParserPair = cf::NamedUnsigned;

// The value as the decimal text a context carries beside it ("%llu").
std::string ParserPairValueText(const ParserPair& pair);

// Move-only, as its name arena is.
struct GenericParserCxt {
  std::vector<ParserPair> pairs;  // in the order added
  ParserNameArena names;          // the characters of the pairs' names
};

// The full statistics context: the pairs plus well-known counters.
struct VSPParseCxt : GenericParserCxt {
  uint32_t exportVersion = 0;
  uint32_t driverVersion = 0;
  uint32_t numVirtualBlocks = 0;
  uint32_t blocksPerVirtualBlock = 0;
  uint32_t pagesPerVirtualBlock = 0;
  uint32_t bytesPerPage = 0;
  uint64_t hostReads = 0;
  uint64_t hostWrites = 0;
  uint64_t numFreeVirtualBlocks = 0;
  uint64_t wearLevMoves = 0;
  uint64_t nandReads = 0;
  uint64_t nandWrites = 0;
  uint64_t bandErases = 0;
  uint64_t IND_pool_free = 0;
  uint64_t IND_pool_count = 0;
  uint64_t utilFormatTime = 0;
  uint64_t numSleepOps = 0;
  uint64_t maxHighEnduranceBlockErases = 0;
  uint64_t readCountHisto[5] = {};
};

inline constexpr size_t kMaxParserNameLength = 98;

// Appends (prefix + name, cut to 98 characters; value). 1 on success, 0 on
// failure (a null context, or no memory).
int AddSingleValueToGenericContext(GenericParserCxt* context, const char* prefix, const char* name, uint64_t value);
// The most elements one array add takes: its index counts in 16 bits.
inline constexpr uint32_t kMaxParserArrayElements = 65536;

// Appends count elements of elementSize bytes (each zero-extended to 64
// bits): one pair under the bare name when count is 1, else name0, name1, ...
// 1 when every element was added (and when there was nothing to add). 0 for
// elements wider than 8 bytes, more than kMaxParserArrayElements elements or
// no memory; a call that fails adds nothing.
int AddMultipleFieldsToGenericContext(GenericParserCxt* context, const char* name, const void* source,
                                      uint32_t elementSize, uint32_t count);
// The same two adds for callers that know the lengths of their names, as
// the parsers' tables do; the context is never null here.
int AddNamedValue(GenericParserCxt& context, std::string_view name, uint64_t value);
int AddNamedArray(GenericParserCxt& context, std::string_view name, const void* source, uint32_t elementSize,
                  uint32_t count);
// Frees every pair and name and empties the context, which can be filled
// again; harmless on an empty context.
void ReleaseGenericParserCxt(GenericParserCxt* context);
// Frees the pairs and zero-fills the whole context, fixed fields included.
void VSPReleaseContext(VSPParseCxt* context);

// Room for the pairs a buffer can yield at most (values never outnumber its
// words; capped for huge buffers), so appending does not reallocate.
void ReservePairs(GenericParserCxt& context, uint64_t max_values);

// The first message recorded in the process wins; at most 1023 characters.
void SetAPIErrorMessageText(std::string_view text);
bool HasAPIErrorMessage();
template <typename... A>
void SetAPIErrorMessage(std::string_view format, const A&... args) {
  if (!HasAPIErrorMessage()) SetAPIErrorMessageText(cf::Format(format, args...));
}
// The recorded message, or "NA" when none was recorded.
std::string GetAPIErrorMessage();

namespace parsers::testing {
// Forgets the recorded message, so each test starts as a new process would.
void ResetAPIErrorMessage();
// After this many more successful adds, adds fail as with an exhausted heap;
// -1 (the default) never fails.
extern int64_t g_adds_before_failure;
}  // namespace parsers::testing
