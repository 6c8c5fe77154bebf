// Parsers of the storage controller's statistics buffers. They take bytes
// from a device they do not control: no input makes them read outside the
// buffer or write outside the output.
#pragma once

#include <cstdint>

#include "parsers/context.h"

// FTL statistics (64-bit word records, end key 0xFFFF) into pairs named
// name / name_0, name_1, ... Returns the number of values added; 0 means
// nothing was parsed. Anomalies go to the last-error message.
uint32_t VSPFTLParseBufferToCxt(GenericParserCxt* context, const void* buffer, uint32_t size);

// The same records into a full statistics context: array elements named
// name0, name1, ..., well-known counters kept in fixed fields. 1 when the
// records fill the buffer exactly, else 0 (with exportVersion zeroed on a
// bad record). No end marker, no messages.
uint32_t VSPParseBufferToCxt(VSPParseCxt* context, const void* buffer, uint32_t size);

// MSP statistics (16-bit key and byte length, 32-bit elements; 0x2FFE
// fillers, 0x2FFF end). Returns the number of values added.
uint32_t VSPMSPParseBufferToCxt(GenericParserCxt* context, const void* buffer, uint32_t size);

// Snapshot records of the fixed 63-word layout as text: a legend, then one
// line per 252-byte record. outSize: in the capacity of out, out the length
// written. 1 when everything fitted, else 0 with what fitted.
int VSPParseSnapshotBuffer(const void* entries, uint32_t size, char* out, uint32_t* outSize);

// Snapshot records as text, driven by the controller's header (record size
// and count, legend, field descriptors with their own formats). Prints from
// *index on into out; outSize: in the capacity, out the text length plus 1.
// *index: in the first record (0 starts a dump with the preamble), out the
// next one. 1 when the dump is complete, 0 when out was too small (call
// again with the returned index). headerSize bounds every read of the header.
int VSPParseSnapshotBufferWithInplaceParser(const void* data, uint32_t dataSize, char* out, uint32_t* outSize,
                                            const void* header, uint32_t headerSize, uint32_t* index);

// The legend that both snapshot dumps print for the fixed layout.
extern const char kSnapshotLegend[];
