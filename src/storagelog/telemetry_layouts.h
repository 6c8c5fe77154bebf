// The per-bus counter layouts of the telemetry list. Each bus's 4096-byte
// block is brought into one fixed record, VendorCounters, by copying runs of
// raw 32-bit words; which runs depends on the controller chip and, for the
// older chip, on the NAND part. Words no run writes stay 0.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>

namespace storagelog {

inline constexpr size_t kTelemetryBlockBytes = 4096;
inline constexpr size_t kTelemetrySummaryBytes = 32;
inline constexpr size_t kTelemetryBusBytes = kTelemetryBlockBytes + kTelemetrySummaryBytes;
inline constexpr size_t kVendorCounterWords = 177;
// No layout reads a raw word past this one.
inline constexpr size_t kLastRawWordRead = 532;

struct VendorCounters {
  std::array<uint32_t, kVendorCounterWords> words{};
};
static_assert(sizeof(VendorCounters) == 708);

// words[dest .. dest+count) <- raw words [src .. src+count)
struct WordRun {
  uint16_t dest;
  uint16_t src;
  uint16_t count;
};

// 1y NAND parts on the older chip (and any part not listed otherwise).
inline constexpr WordRun kLayout1y[] = {
    {0, 256, 8},   {8, 265, 1},   {9, 267, 10},  {19, 303, 1},   {20, 390, 2},   {22, 372, 1},
    {33, 278, 8},  {41, 277, 1},  {42, 290, 1},  {43, 371, 1},   {44, 393, 1},   {45, 392, 1},
    {56, 292, 8},  {65, 21, 1},   {66, 305, 2},  {68, 313, 5},   {73, 370, 1},   {74, 15, 1},
    {75, 531, 2},  {103, 318, 20}, {125, 338, 20}, {145, 373, 12},
};
// 1x parts of the first maker.
inline constexpr WordRun kLayout1xSandisk[] = {
    {0, 256, 6},  {8, 265, 1},  {9, 267, 7},   {17, 275, 2}, {19, 301, 1},  {33, 278, 6}, {41, 277, 1},
    {42, 288, 1}, {56, 290, 8}, {65, 16, 1},   {66, 303, 2}, {68, 311, 5},  {74, 10, 1},
};
// 1x parts of the second maker.
inline constexpr WordRun kLayout1xHynix[] = {
    {0, 256, 4},  {8, 263, 1},  {9, 265, 7},   {17, 273, 2}, {19, 297, 1},  {33, 276, 4}, {41, 275, 1},
    {42, 284, 1}, {56, 286, 8}, {65, 16, 1},   {66, 299, 2}, {68, 307, 5},  {74, 10, 1},
};
// The "K3R" chip, whatever the part.
inline constexpr WordRun kLayoutAlgoGeneric[] = {
    {0, 0, 19},    {19, 37, 1},    {20, 117, 2},  {22, 91, 1},    {33, 20, 8},  {41, 19, 1},  {42, 116, 1},
    {43, 90, 1},   {44, 120, 1},   {45, 119, 1},  {56, 28, 8},    {65, 104, 1}, {66, 38, 7},  {73, 89, 1},
    {74, 105, 1},  {75, 114, 2},   {103, 45, 20}, {125, 67, 20},  {145, 92, 12}, {157, 106, 8},
};
// The "K4R" chip, whatever the part.
inline constexpr WordRun kLayoutAlgoGenericK4[] = {
    {0, 0, 8},     {9, 9, 10},    {19, 27, 1},   {20, 105, 2},  {22, 79, 1},   {25, 115, 4},  {29, 8, 1},
    {30, 120, 2},  {32, 110, 1},  {41, 19, 1},   {42, 104, 1},  {43, 78, 1},   {44, 108, 1},  {45, 107, 1},
    {46, 122, 1},  {56, 20, 3},   {60, 23, 3},   {65, 92, 1},   {66, 28, 2},   {74, 93, 1},   {75, 102, 2},
    {78, 30, 3},   {81, 77, 1},   {82, 112, 3},  {85, 126, 1},  {86, 123, 1},  {87, 94, 5},   {93, 99, 3},
    {96, 109, 1},  {97, 111, 1},  {98, 45, 4},   {102, 26, 1},  {103, 33, 12}, {125, 55, 20}, {145, 80, 12},
    {167, 75, 2},
};

// Every run stays inside the record and inside the raw words a block is
// known to carry, so a copy needs no check of its own once the block's
// 4096 bytes are known to be there.
constexpr bool RunsStayInside(std::span<const WordRun> runs) {
  for (const WordRun& r : runs) {
    if (r.count == 0) return false;
    if (r.dest + r.count > kVendorCounterWords) return false;
    if (r.src + r.count > kLastRawWordRead + 1) return false;
  }
  return true;
}
static_assert(RunsStayInside(kLayout1y));
static_assert(RunsStayInside(kLayout1xSandisk));
static_assert(RunsStayInside(kLayout1xHynix));
static_assert(RunsStayInside(kLayoutAlgoGeneric));
static_assert(RunsStayInside(kLayoutAlgoGenericK4));
static_assert((kLastRawWordRead + 1) * 4 <= kTelemetryBlockBytes);

// The five parsers: the block of one bus (4096 bytes) into a zero-filled record.
void parseCounters1y(const uint8_t* block, VendorCounters* counters);
void parseCounters1xSandisk(const uint8_t* block, VendorCounters* counters);
void parseCounters1xHynix(const uint8_t* block, VendorCounters* counters);
void parseCountersAlgoGeneric(const uint8_t* block, VendorCounters* counters);
void parseCountersAlgoGenericK4(const uint8_t* block, VendorCounters* counters);

// The controller chip, from "chip-id".
enum class ChipKind { kOther = 0, kK3R = 1, kK4R = 2 };

// One named group of record words and how many of them each chip kind logs.
struct CounterNames {
  const char* name;
  uint16_t first;
  std::array<uint16_t, 3> count;  // by ChipKind
};
inline constexpr CounterNames kCounterNames[] = {
    {"readStage", 0, {23, 23, 33}},
    {"initialReadStage", 33, {23, 23, 23}},
    {"nandStageOfLife", 56, {8, 8, 8}},
    {"dspExceptionParameter", 65, {12, 12, 38}},
    {"readStage18NumOfErrorsBin", 103, {12, 12, 12}},
    {"readStage9NumOfErrorsBin", 115, {10, 10, 10}},
    {"readStage10NumOfErrorsBin", 125, {10, 10, 10}},
    {"readStage17NumOfErrorsBin", 135, {10, 10, 10}},
    {"readStage19NumOfErrorsBin", 145, {12, 12, 12}},
    {"algoNANDAccessesBin", 157, {0, 8, 0}},
    {"retentionIndication", 165, {0, 0, 12}},
};
constexpr bool NamesStayInside() {
  for (const CounterNames& n : kCounterNames)
    for (uint16_t c : n.count)
      if (n.first + c > kVendorCounterWords) return false;
  return true;
}
static_assert(NamesStayInside());

// The summary words of a bus, in order, under the keys they are logged with.
inline constexpr const char* kBusSummaryKeys[] = {"RD", "PE", "Max_PE_rate", "t0", "Ret", "block_type", "num_pages"};

}  // namespace storagelog
