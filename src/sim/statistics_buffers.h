// Encoders of the storage controller's statistics buffers, so that tests and
// the simulated controller write buffers field by field rather than as hex.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "cf/value.h"

namespace sim {

// 64-bit little-endian word records: a header word (key in bits 0-31,
// payload length in words in bits 32-63) and the payload words.
class WordRecordBuffer {
 public:
  WordRecordBuffer& Record(uint32_t key, const std::vector<uint64_t>& payload);
  // A header that claims a length, with whatever payload follows it.
  WordRecordBuffer& Header(uint32_t key, uint32_t length);
  WordRecordBuffer& Word(uint64_t raw);
  WordRecordBuffer& End() { return Record(0xFFFF, {0}); }
  WordRecordBuffer& Bytes(const std::string& raw);
  const std::string& bytes() const { return bytes_; }
  uint32_t size() const { return static_cast<uint32_t>(bytes_.size()); }

 private:
  std::string bytes_;
};

// Byte records: 16-bit key, 16-bit payload length in bytes, then the payload.
class ByteRecordBuffer {
 public:
  ByteRecordBuffer& Record(uint16_t key, const std::vector<uint32_t>& elements);
  ByteRecordBuffer& RecordBytes(uint16_t key, const std::string& payload);
  ByteRecordBuffer& Header(uint16_t key, uint16_t length);
  ByteRecordBuffer& Filler() { return Header(0, 0); }  // a 4-byte header of length 0
  ByteRecordBuffer& End() { return RecordBytes(0x2FFF, std::string(4, '\0')); }
  ByteRecordBuffer& Bytes(const std::string& raw);
  const std::string& bytes() const { return bytes_; }
  uint32_t size() const { return static_cast<uint32_t>(bytes_.size()); }

 private:
  std::string bytes_;
};

// A snapshot: the self-describing header (version, record size and count,
// legend, field descriptors) and the records.
class SnapshotBuilder {
 public:
  SnapshotBuilder(uint32_t version, uint32_t entry_size) : version_(version), entry_size_(entry_size) {}
  SnapshotBuilder& Legend(const std::string& text) {
    legend_ = text;
    return *this;
  }
  // type 0/1: one value; 2: thousandths; 3: size/12 per-priority triples.
  SnapshotBuilder& Field(uint16_t type, uint32_t offset, uint32_t size, const std::string& format);
  // One record of entry_size bytes: the words from its start, zeros after.
  SnapshotBuilder& Record(const std::vector<uint32_t>& words);
  // Overrides the record count the header claims (defaults to the records added).
  SnapshotBuilder& ClaimCount(uint32_t count) {
    claimed_count_ = count;
    return *this;
  }
  std::string Header() const;
  const std::string& Data() const { return data_; }

 private:
  struct Desc {
    uint16_t type;
    uint32_t offset, size;
    std::string format;
  };
  uint32_t version_, entry_size_;
  std::string legend_;
  std::vector<Desc> fields_;
  std::string data_;
  uint32_t records_ = 0;
  int64_t claimed_count_ = -1;
};

// One record of the fixed 63-word snapshot layout.
std::string FixedSnapshotRecord(const std::vector<uint32_t>& words);

// Buffers described field by field, as a person writes them in
// controller.plist: field name -> number, or an array of numbers (one
// element each), in the dictionary's order. Nothing (reason in *error) for
// an unknown name, a value that is not a non-negative integer, or more
// values than a record can hold.
std::optional<std::string> EncodeFtlFields(const cf::Dictionary& fields, std::string* error);
std::optional<std::string> EncodeMspFields(const cf::Dictionary& fields, std::string* error);

// A complete FTL buffer: every field of the table once, arrays at their full
// count, values that differ from field to field, then the end marker.
std::string CompleteFtlBuffer();
// A complete MSP buffer: every field at its full count, then the end marker.
std::string CompleteMspBuffer();

}  // namespace sim
