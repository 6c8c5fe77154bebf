#include "sim/statistics_buffers.h"

#include <cstring>

#include "parsers/ftl_table.h"
#include "parsers/msp_table.h"

namespace sim {
namespace {

template <typename T>
void Put(std::string& out, T v) {
  for (size_t i = 0; i < sizeof(T); ++i) out += static_cast<char>((static_cast<uint64_t>(v) >> (8 * i)) & 0xFF);
}

}  // namespace

WordRecordBuffer& WordRecordBuffer::Record(uint32_t key, const std::vector<uint64_t>& payload) {
  Header(key, static_cast<uint32_t>(payload.size()));
  for (uint64_t w : payload) Put(bytes_, w);
  return *this;
}

WordRecordBuffer& WordRecordBuffer::Header(uint32_t key, uint32_t length) {
  return Word(uint64_t{key} | (uint64_t{length} << 32));
}

WordRecordBuffer& WordRecordBuffer::Word(uint64_t raw) {
  Put(bytes_, raw);
  return *this;
}

WordRecordBuffer& WordRecordBuffer::Bytes(const std::string& raw) {
  bytes_ += raw;
  return *this;
}

ByteRecordBuffer& ByteRecordBuffer::Record(uint16_t key, const std::vector<uint32_t>& elements) {
  std::string payload;
  for (uint32_t e : elements) Put(payload, e);
  return RecordBytes(key, payload);
}

ByteRecordBuffer& ByteRecordBuffer::RecordBytes(uint16_t key, const std::string& payload) {
  Header(key, static_cast<uint16_t>(payload.size()));
  bytes_ += payload;
  return *this;
}

ByteRecordBuffer& ByteRecordBuffer::Header(uint16_t key, uint16_t length) {
  Put(bytes_, key);
  Put(bytes_, length);
  return *this;
}

ByteRecordBuffer& ByteRecordBuffer::Bytes(const std::string& raw) {
  bytes_ += raw;
  return *this;
}

SnapshotBuilder& SnapshotBuilder::Field(uint16_t type, uint32_t offset, uint32_t size, const std::string& format) {
  fields_.push_back({type, offset, size, format.substr(0, 15)});
  return *this;
}

SnapshotBuilder& SnapshotBuilder::Record(const std::vector<uint32_t>& words) {
  std::string record;
  for (uint32_t w : words) Put(record, w);
  record.resize(entry_size_, '\0');
  data_ += record;
  ++records_;
  return *this;
}

std::string SnapshotBuilder::Header() const {
  // Fixed part (36 bytes), the legend, then the descriptor table.
  std::string legend = version_ >= 6 ? legend_ + '\0' : std::string();
  const uint32_t table = static_cast<uint32_t>(36 + legend.size());
  std::string h;
  Put(h, uint32_t{0x534E4150});  // not read
  Put(h, version_);
  Put(h, entry_size_);
  Put(h, claimed_count_ >= 0 ? static_cast<uint32_t>(claimed_count_) : records_);
  Put(h, uint32_t{0});
  Put(h, uint32_t{0});
  Put(h, table);
  Put(h, uint32_t{0});
  Put(h, uint32_t{0});
  h += legend;
  Put(h, static_cast<uint32_t>(fields_.size()));
  Put(h, uint32_t{0});
  for (const Desc& d : fields_) {
    Put(h, d.type);
    Put(h, uint16_t{0});
    Put(h, d.offset);
    Put(h, d.size);
    std::string format = d.format;
    format.resize(16, '\0');
    h += format;
  }
  return h;
}

std::string FixedSnapshotRecord(const std::vector<uint32_t>& words) {
  std::string record;
  for (uint32_t w : words) Put(record, w);
  record.resize(63 * 4, '\0');
  return record;
}

namespace {

// The values of one field: a number, or an array of numbers.
bool FieldValues(const cf::Value& name, const cf::Value& value, uint64_t max_value, std::vector<uint64_t>* out,
                 std::string* error) {
  auto one = [&](const cf::Value& v) {
    const cf::Number* n = v.AsNumber();
    if (!n || n->IsFloat() || (!n->IsUnsigned() && n->AsSInt64() < 0) || n->AsUInt64() > max_value) return false;
    out->push_back(n->AsUInt64());
    return true;
  };
  bool ok = true;
  if (const cf::Array* a = value.AsArray()) {
    for (const cf::Value& v : *a) ok = ok && one(v);
  } else {
    ok = one(value);
  }
  if (!ok && error) *error = "field \"" + name.Description() + "\": values must be integers from 0 to " + std::to_string(max_value);
  return ok;
}

template <typename Fields>
auto FindByName(const Fields& table, const cf::Value& name) -> decltype(&table[0]) {
  if (const cf::String* text = name.AsString())
    for (const auto& row : table)
      if (*text == row.name) return &row;
  return nullptr;
}

// Walks a field dictionary: each name looked up in the table, its values
// checked, then handed to add(field, name, values) to encode.
template <typename Fields, typename Add>
bool EncodeFields(const cf::Dictionary& fields, const Fields& table, const char* kind, uint64_t max_value,
                  std::string* error, Add add) {
  for (const auto& [name, value] : fields) {
    const auto* f = FindByName(table, name);
    if (!f) {
      if (error) *error = std::string("unknown ") + kind + " field \"" + name.Description() + "\"";
      return false;
    }
    std::vector<uint64_t> values;
    if (!FieldValues(name, value, max_value, &values, error) || !add(*f, name, values)) return false;
  }
  return true;
}

}  // namespace

std::optional<std::string> EncodeFtlFields(const cf::Dictionary& fields, std::string* error) {
  WordRecordBuffer b;
  const bool ok = EncodeFields(fields, parsers::FtlFields(), "FTL", UINT64_MAX, error,
                               [&](const parsers::FtlField& f, const cf::Value&, const std::vector<uint64_t>& values) {
                                 b.Record(f.key, values);
                                 return true;
                               });
  if (!ok) return std::nullopt;
  return b.End().bytes();
}

std::optional<std::string> EncodeMspFields(const cf::Dictionary& fields, std::string* error) {
  ByteRecordBuffer b;
  const bool ok = EncodeFields(
      fields, parsers::MspFields(), "MSP", UINT32_MAX, error,
      [&](const parsers::MspField& f, const cf::Value& name, const std::vector<uint64_t>& values) {
        if (values.size() > 0xFFFF / 4) {
          if (error) *error = "field \"" + name.Description() + "\": more values than a record holds";
          return false;
        }
        b.Record(static_cast<uint16_t>(f.key), std::vector<uint32_t>(values.begin(), values.end()));
        return true;
      });
  if (!ok) return std::nullopt;
  return b.End().bytes();
}

std::string CompleteFtlBuffer() {
  WordRecordBuffer b;
  uint64_t v = 1000;
  for (const parsers::FtlField& f : parsers::FtlFields()) {
    std::vector<uint64_t> payload(f.is_array() ? f.count : 1);
    for (uint64_t& w : payload) w = v++;
    b.Record(f.key, payload);
  }
  return b.End().bytes();
}

std::string CompleteMspBuffer() {
  ByteRecordBuffer b;
  uint32_t v = 1;
  for (const parsers::MspField& f : parsers::MspFields()) {
    std::vector<uint32_t> elements(f.count);
    for (uint32_t& e : elements) e = v++;
    b.Record(static_cast<uint16_t>(f.key), elements);
  }
  return b.End().bytes();
}

}  // namespace sim
