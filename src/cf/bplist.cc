// Reader of binary property lists ("bplist00"). Written here rather than
// taken from libplist because that reader aborts the process (assertions)
// on some hostile inputs, and binary lists arrive over the service socket.
#include <algorithm>
#include <cstring>

#include "cf/plist.h"

namespace cf {
namespace {

constexpr double kPlistEpoch = 978307200.0;  // 2001-01-01 in Unix seconds
// Shared objects let a small list describe a huge tree (one long string
// referenced from every slot of an array), so the decoded tree is bounded in
// bytes: each object costs a fixed amount (its value and its slot in the
// parent) plus its string or data bytes, and the total may be at most
// kDecodedBytesPerInputByte times the input and never over kMaxDecodedBytes.
constexpr uint64_t kDecodedObjectCost = 32;
constexpr uint64_t kDecodedBytesPerInputByte = 32;
constexpr uint64_t kMaxDecodedBytes = uint64_t{64} << 20;

class Reader {
 public:
  explicit Reader(std::string_view bytes)
      : b_(reinterpret_cast<const uint8_t*>(bytes.data())),
        n_(bytes.size()),
        budget_(std::min<uint64_t>(kMaxDecodedBytes, n_ * kDecodedBytesPerInputByte)) {}

  bool Parse(Value& out, std::string& error) {
    if (n_ < 8 + 32 || std::memcmp(b_, "bplist00", 8) != 0) return Fail("malformed binary property list", error);
    const uint8_t* t = b_ + n_ - 32;
    offset_size_ = t[6];
    ref_size_ = t[7];
    objects_ = BigEndian(t + 8, 8);
    const uint64_t top = BigEndian(t + 16, 8);
    table_ = BigEndian(t + 24, 8);
    const uint64_t table_end_limit = n_ - 32;
    if (offset_size_ < 1 || offset_size_ > 8 || ref_size_ < 1 || ref_size_ > 8 || objects_ == 0 ||
        top >= objects_ || table_ < 8 || table_ > table_end_limit ||
        objects_ > (table_end_limit - table_) / offset_size_)
      return Fail("malformed binary property list (trailer)", error);
    return Object(top, 0, out, error);
  }

 private:
  static bool Fail(const char* why, std::string& error) {
    error = why;
    return false;
  }

  static uint64_t BigEndian(const uint8_t* p, size_t size) {
    uint64_t v = 0;
    for (size_t i = 0; i < size; ++i) v = (v << 8) | p[i];
    return v;
  }

  // Charges decoded bytes against the budget before they are allocated.
  bool Spend(uint64_t bytes, std::string& error) {
    if (bytes > budget_) return Fail("binary property list too large when decoded", error);
    budget_ -= bytes;
    return true;
  }

  bool Have(uint64_t at, uint64_t size) const { return at <= table_ && size <= table_ - at; }

  bool OffsetOf(uint64_t ref, uint64_t* at) const {
    if (ref >= objects_) return false;
    *at = BigEndian(b_ + table_ + ref * offset_size_, offset_size_);
    return *at >= 8 && *at < table_;
  }

  // The count of a container or string: the marker's low nibble, or an
  // integer object after it when the nibble is 0xF.
  bool Count(uint64_t* at, uint8_t marker, uint64_t* count) const {
    if ((marker & 0x0F) != 0x0F) {
      *count = marker & 0x0F;
      return true;
    }
    if (!Have(*at, 1)) return false;
    const uint8_t int_marker = b_[*at];
    if ((int_marker & 0xF0) != 0x10 || (int_marker & 0x0F) > 3) return false;
    const uint64_t size = uint64_t{1} << (int_marker & 0x0F);
    if (!Have(*at + 1, size)) return false;
    *count = BigEndian(b_ + *at + 1, size);
    *at += 1 + size;
    return true;
  }

  bool Object(uint64_t ref, int depth, Value& out, std::string& error) {
    if (depth > kMaxNesting) return Fail("property list nested too deeply", error);
    if (!Spend(kDecodedObjectCost, error)) return false;
    uint64_t at = 0;
    if (!OffsetOf(ref, &at)) return Fail("malformed binary property list (object offset)", error);
    const uint8_t marker = b_[at++];
    const uint8_t low = marker & 0x0F;
    switch (marker >> 4) {
      case 0x0:
        if (marker == 0x00) out = Value();
        else if (marker == 0x08) out = Value::Bool(false);
        else if (marker == 0x09) out = Value::Bool(true);
        else return Fail("malformed binary property list (unknown object)", error);
        return true;
      case 0x1: {
        if (low > 4 || !Have(at, uint64_t{1} << low)) return Fail("malformed binary property list (integer)", error);
        if (low < 3) {
          out = Number::SInt64(static_cast<int64_t>(BigEndian(b_ + at, uint64_t{1} << low)));
        } else if (low == 3) {
          out = Number::SInt64(static_cast<int64_t>(BigEndian(b_ + at, 8)));
        } else {
          // 128 bits: the unsigned 64-bit range, or a negative 64-bit value.
          const uint64_t high = BigEndian(b_ + at, 8), low64 = BigEndian(b_ + at + 8, 8);
          if (high == 0) out = low64 > static_cast<uint64_t>(INT64_MAX) ? Value(Number::UInt64(low64)) : Value(Number::SInt64(static_cast<int64_t>(low64)));
          else if (high == UINT64_MAX && low64 > static_cast<uint64_t>(INT64_MAX)) out = Number::SInt64(static_cast<int64_t>(low64));
          else return Fail("binary property list integer out of range", error);
        }
        return true;
      }
      case 0x2: {
        if ((low != 2 && low != 3) || !Have(at, uint64_t{1} << low)) return Fail("malformed binary property list (real)", error);
        if (low == 2) {
          const uint32_t bits = static_cast<uint32_t>(BigEndian(b_ + at, 4));
          float f;
          std::memcpy(&f, &bits, 4);
          out = Number::Float64(f);
        } else {
          const uint64_t bits = BigEndian(b_ + at, 8);
          double d;
          std::memcpy(&d, &bits, 8);
          out = Number::Float64(d);
        }
        return true;
      }
      case 0x3: {
        if (marker != 0x33 || !Have(at, 8)) return Fail("malformed binary property list (date)", error);
        const uint64_t bits = BigEndian(b_ + at, 8);
        double d;
        std::memcpy(&d, &bits, 8);
        out = Date{kPlistEpoch + d};
        return true;
      }
      case 0x4:
      case 0x5: {
        uint64_t count = 0;
        if (!Count(&at, marker, &count) || !Have(at, count)) return Fail("malformed binary property list (data)", error);
        if (!Spend(count, error)) return false;
        const char* p = reinterpret_cast<const char*>(b_ + at);
        if (marker >> 4 == 0x4) out = Value::Bytes(Data(b_ + at, b_ + at + count));
        else out = std::string(p, count);
        return true;
      }
      case 0x6: {
        uint64_t count = 0;
        if (!Count(&at, marker, &count) || count > table_ || !Have(at, count * 2))
          return Fail("malformed binary property list (text)", error);
        if (!Spend(count * 3, error)) return false;  // UTF-8 takes up to 3 bytes a unit
        out = Utf16ToUtf8(b_ + at, count);
        return true;
      }
      case 0x8:
        if (!Have(at, uint64_t{low} + 1)) return Fail("malformed binary property list (uid)", error);
        out = Number::UInt64(BigEndian(b_ + at, std::min<uint64_t>(uint64_t{low} + 1, 8)));
        return true;
      case 0xA:
      case 0xC: {
        uint64_t count = 0;
        if (!Count(&at, marker, &count) || count > table_ || !Have(at, count * ref_size_))
          return Fail("malformed binary property list (array)", error);
        Array a;
        for (uint64_t i = 0; i < count; ++i) {
          Value item;
          if (!Object(BigEndian(b_ + at + i * ref_size_, ref_size_), depth + 1, item, error)) return false;
          a.Append(std::move(item));
        }
        out = a;
        return true;
      }
      case 0xD: {
        uint64_t count = 0;
        if (!Count(&at, marker, &count) || count > table_ || !Have(at, count * 2 * ref_size_))
          return Fail("malformed binary property list (dictionary)", error);
        Dictionary d;
        for (uint64_t i = 0; i < count; ++i) {
          Value key, value;
          if (!Object(BigEndian(b_ + at + i * ref_size_, ref_size_), depth + 1, key, error) ||
              !Object(BigEndian(b_ + at + (count + i) * ref_size_, ref_size_), depth + 1, value, error))
            return false;
          d.Set(std::move(key), std::move(value));
        }
        out = d;
        return true;
      }
      default:
        return Fail("malformed binary property list (unknown object)", error);
    }
  }

  static std::string Utf16ToUtf8(const uint8_t* p, uint64_t units) {
    std::string out;
    out.reserve(units);
    auto put = [&](uint32_t c) {
      if (c < 0x80) {
        out += static_cast<char>(c);
      } else if (c < 0x800) {
        out += static_cast<char>(0xC0 | (c >> 6));
        out += static_cast<char>(0x80 | (c & 0x3F));
      } else if (c < 0x10000) {
        out += static_cast<char>(0xE0 | (c >> 12));
        out += static_cast<char>(0x80 | ((c >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (c & 0x3F));
      } else {
        out += static_cast<char>(0xF0 | (c >> 18));
        out += static_cast<char>(0x80 | ((c >> 12) & 0x3F));
        out += static_cast<char>(0x80 | ((c >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (c & 0x3F));
      }
    };
    for (uint64_t i = 0; i < units; ++i) {
      const uint32_t u = (uint32_t{p[2 * i]} << 8) | p[2 * i + 1];
      if (u >= 0xD800 && u < 0xDC00 && i + 1 < units) {
        const uint32_t v = (uint32_t{p[2 * i + 2]} << 8) | p[2 * i + 3];
        if (v >= 0xDC00 && v < 0xE000) {
          put(0x10000 + ((u - 0xD800) << 10) + (v - 0xDC00));
          ++i;
          continue;
        }
      }
      put(u >= 0xD800 && u < 0xE000 ? 0xFFFD : u);  // a lone surrogate
    }
    return out;
  }

  const uint8_t* b_;
  uint64_t n_;
  uint8_t offset_size_ = 0, ref_size_ = 0;
  uint64_t objects_ = 0, table_ = 0;
  uint64_t budget_;  // decoded bytes still allowed
};

}  // namespace

bool ParseBinaryPropertyList(std::string_view bytes, Value& out, std::string& error) {
  return Reader(bytes).Parse(out, error);
}

}  // namespace cf
