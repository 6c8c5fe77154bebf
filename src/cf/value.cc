#include "cf/value.h"

#include <algorithm>
#include <cctype>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <functional>
#include <limits>
#include <new>
#include <ostream>
#include <stdexcept>

namespace cf {

namespace {

using Int128 = __int128;

template <typename T>
T SaturatingTruncate(double d) {
  if (std::isnan(d)) return 0;
  d = std::trunc(d);
  // Compare in long double so the bounds are exact for 64-bit targets.
  const long double ld = d;
  if (ld <= static_cast<long double>(std::numeric_limits<T>::min())) return std::numeric_limits<T>::min();
  if (ld >= static_cast<long double>(std::numeric_limits<T>::max())) return std::numeric_limits<T>::max();
  return static_cast<T>(d);
}

uint64_t LowBits(NumberType type, int64_t v) {
  switch (type) {
    case NumberType::kSInt8:
      return static_cast<uint64_t>(static_cast<int64_t>(static_cast<int8_t>(v)));
    case NumberType::kSInt16:
      return static_cast<uint64_t>(static_cast<int64_t>(static_cast<int16_t>(v)));
    case NumberType::kSInt32:
    case NumberType::kInt:
      return static_cast<uint64_t>(static_cast<int64_t>(static_cast<int32_t>(v)));
    default:
      return static_cast<uint64_t>(v);
  }
}

size_t Mix(size_t h, size_t v) { return h ^ (v + 0x9e3779b97f4a7c15ULL + (h << 6) + (h >> 2)); }

uint64_t Load8(const char* p) {
  uint64_t w;
  std::memcpy(&w, p, 8);
  return w;
}
uint64_t Load4(const char* p) {
  uint32_t w;
  std::memcpy(&w, p, 4);
  return w;
}
uint64_t Fold(uint64_t x) {
  x ^= x >> 31;
  x *= 0xbf58476d1ce4e5b9ULL;
  return x ^ (x >> 29);
}

// Two lanes of 8-byte words, each folded by a multiply; the last words may
// overlap the ones before. Names of a few dozen characters take a few
// multiplies.
uint32_t HashBytes(const char* p, size_t n) {
  uint64_t a = 0x9e3779b97f4a7c15ULL ^ n, b = 0xc2b2ae3d27d4eb4fULL;
  while (n > 16) {
    a = Fold(a ^ Load8(p));
    b = Fold(b ^ Load8(p + 8));
    p += 16;
    n -= 16;
  }
  if (n > 8) {
    a ^= Load8(p);
    b ^= Load8(p + n - 8);
  } else if (n >= 4) {
    a ^= Load4(p) | Load4(p + n - 4) << 32;
  } else if (n > 0) {
    a ^= static_cast<uint64_t>(static_cast<unsigned char>(p[0])) |
         static_cast<uint64_t>(static_cast<unsigned char>(p[n / 2])) << 8 |
         static_cast<uint64_t>(static_cast<unsigned char>(p[n - 1])) << 16;
  }
  const uint64_t h = Fold(Fold(a) ^ b);
  return static_cast<uint32_t>(h ^ (h >> 32));
}

internal::TextBlock* NewTextBlock(size_t characters, size_t references) {
  void* memory = ::operator new(sizeof(internal::TextBlock) + characters);
  return new (memory) internal::TextBlock{references};
}

char* TextOf(internal::TextBlock* block) { return reinterpret_cast<char*>(block + 1); }

// The 16 bytes of a string's representation, written with one store: the
// caller moves the new string at once, and a 16-byte load of bytes that
// narrower stores have just written waits for them to reach the cache.
using Words = uint64_t __attribute__((vector_size(16)));
template <typename Rep>
void StoreRep(Rep& rep, Words words) {
  static_assert(sizeof(Rep) == sizeof(Words));
  std::memcpy(&rep, &words, sizeof words);
}

// Up to 15 characters and the zeros after them, as two little-endian words
// read from the text without reading past it.
Words LocalWords(const char* p, size_t n) {
  uint64_t lo = 0, hi = 0;
  if (n > 8) {
    lo = Load8(p);
    hi = Load8(p + n - 8) >> (8 * (16 - n));
  } else if (n == 8) {
    lo = Load8(p);
  } else if (n >= 4) {
    lo = Load4(p) | Load4(p + n - 4) << (8 * (n - 4));
  } else {
    for (size_t i = 0; i < n; ++i) lo |= static_cast<uint64_t>(static_cast<unsigned char>(p[i])) << (8 * i);
  }
  return Words{lo, hi};
}

}  // namespace

// ---- strings ----

size_t String::HashOf(std::string_view text) { return HashBytes(text.data(), text.size()); }
size_t String::HashOfEmpty() {
  static const size_t kHash = HashBytes("", 0);
  return kHash;
}

String::String(std::string_view text) {
  if (text.size() > std::numeric_limits<uint32_t>::max()) throw std::length_error("cf::String too long");
  size_ = static_cast<uint32_t>(text.size());
  hash_ = HashBytes(text.data(), text.size());
  if (!IsShared()) {
    StoreRep(rep_, LocalWords(text.data(), text.size()));
    return;
  }
  internal::TextBlock* block = NewTextBlock(text.size() + 1, 1);
  char* out = TextOf(block);
  std::memcpy(out, text.data(), text.size());
  out[text.size()] = 0;
  StoreRep(rep_, Words{reinterpret_cast<uintptr_t>(block), reinterpret_cast<uintptr_t>(out)});
}

void String::Release(internal::TextBlock* block, size_t n) noexcept {
  if (block->references.fetch_sub(n, std::memory_order_acq_rel) == n) {
    block->~TextBlock();
    ::operator delete(block);
  }
}

std::ostream& operator<<(std::ostream& os, const String& s) { return os << s.view(); }

StringBlock::StringBlock(size_t count, size_t characters) {
  if (count == 0) return;
  left_ = characters + count;
  credits_ = count;
  block_ = NewTextBlock(left_, count);
  cursor_ = TextOf(block_);
}

StringBlock::~StringBlock() {
  if (credits_) String::Release(block_, credits_);
}


bool Number::IsFloat() const {
  return type_ == NumberType::kFloat32 || type_ == NumberType::kFloat64 ||
         type_ == NumberType::kFloat || type_ == NumberType::kDouble;
}

Number Number::Make(NumberType type, int64_t v) {
  Number n;
  n.type_ = type;
  if (n.IsFloat()) {
    n.real_ = (type == NumberType::kFloat32 || type == NumberType::kFloat)
                  ? static_cast<double>(static_cast<float>(v))
                  : static_cast<double>(v);
  } else {
    n.bits_ = LowBits(type, v);
  }
  return n;
}

Number Number::MakeDouble(NumberType type, double v) {
  Number n;
  n.type_ = type;
  if (n.IsFloat()) {
    n.real_ = (type == NumberType::kFloat32 || type == NumberType::kFloat)
                  ? static_cast<double>(static_cast<float>(v))
                  : v;
  } else if (type == NumberType::kUInt64) {
    n.bits_ = v < 0 ? static_cast<uint64_t>(SaturatingTruncate<int64_t>(v))
                    : SaturatingTruncate<uint64_t>(v);
  } else {
    n.bits_ = LowBits(type, SaturatingTruncate<int64_t>(v));
  }
  return n;
}

Number Number::UInt64(uint64_t v) {
  Number n;
  n.type_ = NumberType::kUInt64;
  n.bits_ = v;
  return n;
}

int64_t Number::AsSInt64() const {
  if (IsFloat()) return SaturatingTruncate<int64_t>(real_);
  return static_cast<int64_t>(bits_);
}

uint64_t Number::AsUInt64() const {
  if (IsFloat()) {
    // Negative reals go through the signed path so -1.0 reads as 2^64-1,
    // as the low bits of -1 would.
    if (real_ < 0) return static_cast<uint64_t>(SaturatingTruncate<int64_t>(real_));
    return SaturatingTruncate<uint64_t>(real_);
  }
  return bits_;
}

double Number::AsFloat64() const {
  if (IsFloat()) return real_;
  if (IsUnsigned()) return static_cast<double>(bits_);
  return static_cast<double>(static_cast<int64_t>(bits_));
}

int Number::Compare(const Number& o) const {
  if (!IsFloat() && !o.IsFloat()) {
    const Int128 a = IsUnsigned() ? Int128(bits_) : Int128(static_cast<int64_t>(bits_));
    const Int128 b = o.IsUnsigned() ? Int128(o.bits_) : Int128(static_cast<int64_t>(o.bits_));
    return a < b ? -1 : (a > b ? 1 : 0);
  }
  // long double holds every 64-bit integer exactly, so mixed comparisons are exact.
  auto wide = [](const Number& n) -> long double {
    if (n.IsFloat()) return n.real_;
    if (n.IsUnsigned()) return static_cast<long double>(n.bits_);
    return static_cast<long double>(static_cast<int64_t>(n.bits_));
  };
  const long double a = wide(*this), b = wide(o);
  if (std::isnan(a) || std::isnan(b)) {
    if (std::isnan(a) && std::isnan(b)) return 0;
    return std::isnan(a) ? 1 : -1;  // NaN sorts last and equals only NaN
  }
  return a < b ? -1 : (a > b ? 1 : 0);
}

bool Number::operator==(const Number& o) const { return Compare(o) == 0; }

size_t Number::Hash() const {
  // Equal numbers of different types must hash alike: hash integral values
  // as integers and everything else by the bits of the double.
  if (!IsFloat()) {
    const Int128 v = IsUnsigned() ? Int128(bits_) : Int128(static_cast<int64_t>(bits_));
    return Mix(std::hash<uint64_t>()(static_cast<uint64_t>(v)), static_cast<size_t>(v >> 64));
  }
  const double d = real_;
  if (std::isfinite(d) && std::trunc(d) == d && d >= -9223372036854775808.0 && d < 18446744073709551616.0) {
    const Int128 v = d < 0 ? Int128(static_cast<int64_t>(d)) : Int128(static_cast<uint64_t>(d));
    return Mix(std::hash<uint64_t>()(static_cast<uint64_t>(v)), static_cast<size_t>(v >> 64));
  }
  if (std::isnan(d)) return 0x7ff8;
  return std::hash<double>()(d);
}

std::string Number::Description() const {
  char buf[64];
  if (IsFloat()) {
    std::snprintf(buf, sizeof buf, "%0.16g", real_);
  } else if (IsUnsigned()) {
    std::snprintf(buf, sizeof buf, "%llu", static_cast<unsigned long long>(bits_));
  } else {
    std::snprintf(buf, sizeof buf, "%lld", static_cast<long long>(static_cast<int64_t>(bits_)));
  }
  return buf;
}

// ---- containers ----

class ArrayImpl {
 public:
  std::vector<Value> items;
};

class DictionaryImpl {
 public:
  std::vector<std::pair<Value, Value>> entries;
  std::vector<size_t> hashes;
  // Open-addressing index into entries (slot value = index + 1); built only
  // once the dictionary is large enough for a linear scan to hurt.
  std::vector<uint32_t> slots;

  static constexpr size_t kIndexThreshold = 12;

  DictionaryImpl() = default;
  DictionaryImpl(const DictionaryImpl&) = default;
  DictionaryImpl& operator=(const DictionaryImpl&) = default;
  // Gives back the references of keys made in the same block one run at a
  // time instead of one atomic step per key.
  ~DictionaryImpl() {
    internal::TextBlock* run = nullptr;
    size_t n = 0;
    for (auto& entry : entries) {
      String* key = std::get_if<String>(&entry.first.v_);
      if (!key || !key->IsShared()) continue;
      if (key->rep_.shared.block != run) {
        if (run) String::Release(run, n);
        run = key->rep_.shared.block;
        n = 0;
      }
      ++n;
      key->ForgetBlock();
    }
    if (run) String::Release(run, n);
  }

  // Where key is (index into entries), or -1 and, when indexed, the free
  // slot where it would go.
  long FindIndex(const Value& key, size_t h, size_t* free_slot = nullptr) const {
    if (slots.empty()) {
      for (size_t i = 0; i < entries.size(); ++i)
        if (hashes[i] == h && entries[i].first == key) return static_cast<long>(i);
      return -1;
    }
    const size_t mask = slots.size() - 1;
    for (size_t s = h & mask;; s = (s + 1) & mask) {
      const uint32_t slot = slots[s];
      if (slot == 0) {
        if (free_slot) *free_slot = s;
        return -1;
      }
      const size_t i = slot - 1;
      if (hashes[i] == h && entries[i].first == key) return static_cast<long>(i);
    }
  }
  long FindIndex(const Value& key) const { return FindIndex(key, key.Hash()); }

  void Insert(size_t i) {
    const size_t mask = slots.size() - 1;
    size_t s = hashes[i] & mask;
    while (slots[s] != 0) s = (s + 1) & mask;
    slots[s] = static_cast<uint32_t>(i + 1);
  }

  void Rebuild(size_t capacity_hint) {
    slots.clear();
    const size_t n = std::max(capacity_hint, entries.size());
    if (n < kIndexThreshold) return;
    size_t cap = 16;
    while (cap < n * 2) cap <<= 1;
    slots.assign(cap, 0);
    for (size_t i = 0; i < entries.size(); ++i) Insert(i);
  }

  // Appends a new key with hash h; free_slot, when known, is where its
  // probe ended.
  void Append(Value&& key, Value&& value, size_t h, const size_t* free_slot = nullptr) {
    hashes.push_back(h);
    entries.emplace_back(std::move(key), std::move(value));
    if (slots.empty()) {
      if (entries.size() >= kIndexThreshold) Rebuild(entries.size());
    } else if (entries.size() * 2 > slots.size()) {
      Rebuild(entries.size());
    } else if (free_slot) {
      slots[*free_slot] = static_cast<uint32_t>(entries.size());
    } else {
      Insert(entries.size() - 1);
    }
  }
};

Array::Array() : impl_(std::make_shared<ArrayImpl>()) {}
Array::Array(std::vector<Value> items) : impl_(std::make_shared<ArrayImpl>()) {
  impl_->items = std::move(items);
}
size_t Array::size() const { return impl_->items.size(); }
const Value& Array::operator[](size_t i) const { return impl_->items[i]; }
const Value& Array::at(size_t i) const {
  static const Value kNull;
  return i < impl_->items.size() ? impl_->items[i] : kNull;
}
void Array::Append(Value v) { impl_->items.push_back(std::move(v)); }
void Array::Set(size_t i, Value v) {
  if (i < impl_->items.size()) impl_->items[i] = std::move(v);
  else if (i == impl_->items.size()) impl_->items.push_back(std::move(v));
}
void Array::RemoveAt(size_t i) {
  if (i < impl_->items.size()) impl_->items.erase(impl_->items.begin() + static_cast<long>(i));
}
void Array::Clear() { impl_->items.clear(); }
const std::vector<Value>& Array::items() const { return impl_->items; }
std::vector<Value>::const_iterator Array::begin() const { return impl_->items.begin(); }
std::vector<Value>::const_iterator Array::end() const { return impl_->items.end(); }
Array Array::MutableCopy() const { return Array(impl_->items); }

Dictionary::Dictionary() : impl_(std::make_shared<DictionaryImpl>()) {}
size_t Dictionary::size() const { return impl_->entries.size(); }
const Value* Dictionary::Find(const Value& key) const {
  const long i = impl_->FindIndex(key);
  return i < 0 ? nullptr : &impl_->entries[static_cast<size_t>(i)].second;
}
const Value& Dictionary::Get(const Value& key) const {
  static const Value kNull;
  const Value* v = Find(key);
  return v ? *v : kNull;
}
void Dictionary::Set(Value key, Value value) {
  const size_t h = key.Hash();
  size_t free_slot = 0;
  const long i = impl_->FindIndex(key, h, &free_slot);
  if (i >= 0) {
    impl_->entries[static_cast<size_t>(i)].second = std::move(value);
    return;
  }
  impl_->Append(std::move(key), std::move(value), h, impl_->slots.empty() ? nullptr : &free_slot);
}
void Dictionary::AppendUnique(Value key, Value value) {
  const size_t h = key.Hash();
  impl_->Append(std::move(key), std::move(value), h);
}
void Dictionary::Remove(const Value& key) {
  const long i = impl_->FindIndex(key);
  if (i < 0) return;
  impl_->entries.erase(impl_->entries.begin() + i);
  impl_->hashes.erase(impl_->hashes.begin() + i);
  impl_->Rebuild(0);
}
void Dictionary::Clear() {
  impl_->entries.clear();
  impl_->hashes.clear();
  impl_->slots.clear();
}
void Dictionary::Reserve(size_t n) {
  impl_->entries.reserve(n);
  impl_->hashes.reserve(n);
  if (n >= DictionaryImpl::kIndexThreshold && impl_->slots.size() < n * 2) impl_->Rebuild(n);
}
const std::vector<std::pair<Value, Value>>& Dictionary::entries() const { return impl_->entries; }
std::vector<std::pair<Value, Value>>::const_iterator Dictionary::begin() const {
  return impl_->entries.begin();
}
std::vector<std::pair<Value, Value>>::const_iterator Dictionary::end() const {
  return impl_->entries.end();
}
Dictionary Dictionary::MutableCopy() const {
  Dictionary d;
  *d.impl_ = *impl_;
  return d;
}

// ---- Value ----

const char* TypeName(Type t) {
  switch (t) {
    case Type::kNull: return "null";
    case Type::kBoolean: return "boolean";
    case Type::kNumber: return "number";
    case Type::kString: return "string";
    case Type::kData: return "data";
    case Type::kDate: return "date";
    case Type::kArray: return "array";
    case Type::kDictionary: return "dictionary";
  }
  return "?";
}

std::string TypeNameWithArticle(Type t) {
  const std::string name = TypeName(t);
  return (t == Type::kArray ? "an " : "a ") + name;
}

const Data* Value::AsData() const {
  auto p = std::get_if<std::shared_ptr<const Data>>(&v_);
  return p ? p->get() : nullptr;
}

bool Value::operator==(const Value& o) const {
  if (type() != o.type()) return false;
  switch (type()) {
    case Type::kNull: return true;
    case Type::kBoolean: return *AsBool() == *o.AsBool();
    case Type::kNumber: return *AsNumber() == *o.AsNumber();
    case Type::kString: return *AsString() == *o.AsString();
    case Type::kData: return *AsData() == *o.AsData();
    case Type::kDate: return *AsDate() == *o.AsDate();
    case Type::kArray: {
      const Array& a = *AsArray();
      const Array& b = *o.AsArray();
      if (a.SameAs(b)) return true;
      return a.items() == b.items();
    }
    case Type::kDictionary: {
      const Dictionary& a = *AsDictionary();
      const Dictionary& b = *o.AsDictionary();
      if (a.SameAs(b)) return true;
      if (a.size() != b.size()) return false;
      for (const auto& [k, v] : a) {
        const Value* other = b.Find(k);
        if (!other || !(*other == v)) return false;
      }
      return true;
    }
  }
  return false;
}

size_t Value::Hash() const {
  const size_t t = static_cast<size_t>(type());
  switch (type()) {
    case Type::kNull: return 0x51;
    case Type::kBoolean: return Mix(t, *AsBool());
    // Numbers hash without their type tag so 3 and 3.0 land together.
    case Type::kNumber: return AsNumber()->Hash();
    case Type::kString: return AsString()->hash();
    case Type::kData:
      return Mix(t, std::hash<std::string_view>()(std::string_view(
                        reinterpret_cast<const char*>(AsData()->data()), AsData()->size())));
    case Type::kDate: return Mix(t, std::hash<double>()(AsDate()->seconds));
    // Containers hash by size only: cheap, and consistent with element-wise
    // equality (dictionary order does not matter).
    case Type::kArray: return Mix(t, AsArray()->size());
    case Type::kDictionary: return Mix(t, AsDictionary()->size());
  }
  return 0;
}

std::string FormatUTC(const Date& d, bool iso8601) {
  // Dates from outside can be anything; texts stay within years 1 to 9999.
  constexpr double kFirst = -62135596800.0, kLast = 253402300799.0;
  const double clamped = std::isnan(d.seconds) ? 0 : std::min(std::max(std::floor(d.seconds), kFirst), kLast);
  const time_t secs = static_cast<time_t>(clamped);
  struct tm tm;
  gmtime_r(&secs, &tm);
  char buf[64];
  std::snprintf(buf, sizeof buf, iso8601 ? "%04d-%02d-%02dT%02d:%02d:%02dZ" : "%04d-%02d-%02d %02d:%02d:%02d +0000",
                tm.tm_year + 1900, tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec);
  return buf;
}

std::string DateDescription(const Date& d) { return FormatUTC(d, false); }

namespace {

bool NeedsQuotes(std::string_view s) {
  if (s.empty()) return true;
  for (unsigned char c : s)
    if (!(std::isalnum(c) || c == '_' || c == '.' || c == '-' || c >= 0x80)) return true;
  return false;
}

std::string Quoted(std::string_view s) {
  if (!NeedsQuotes(s)) return std::string(s);
  std::string out = "\"";
  for (char c : s) {
    if (c == '"' || c == '\\') out += '\\';
    if (c == '\n') {
      out += "\\n";
      continue;
    }
    out += c;
  }
  return out + "\"";
}

void Describe(const Value& v, int depth, bool nested, std::string& out) {
  const std::string pad(static_cast<size_t>(depth) * 4, ' ');
  const std::string inner(static_cast<size_t>(depth + 1) * 4, ' ');
  switch (v.type()) {
    case Type::kNull: out += "<null>"; return;
    case Type::kBoolean: out += *v.AsBool() ? "true" : "false"; return;
    case Type::kNumber: out += v.AsNumber()->Description(); return;
    case Type::kString: out += nested ? Quoted(v.StringView()) : v.StringView(); return;
    case Type::kDate: out += DateDescription(*v.AsDate()); return;
    case Type::kData: {
      static const char* hex = "0123456789abcdef";
      out += '<';
      const Data& d = *v.AsData();
      for (size_t i = 0; i < d.size(); ++i) {
        if (i && i % 4 == 0) out += ' ';
        out += hex[d[i] >> 4];
        out += hex[d[i] & 15];
      }
      out += '>';
      return;
    }
    case Type::kArray: {
      const Array& a = *v.AsArray();
      if (a.empty()) {
        out += "()";
        return;
      }
      out += "(\n";
      for (size_t i = 0; i < a.size(); ++i) {
        out += inner;
        Describe(a[i], depth + 1, true, out);
        out += i + 1 < a.size() ? ",\n" : "\n";
      }
      out += pad + ")";
      return;
    }
    case Type::kDictionary: {
      const Dictionary& d = *v.AsDictionary();
      if (d.empty()) {
        out += "{}";
        return;
      }
      out += "{\n";
      for (const auto& [k, val] : d) {
        out += inner;
        Describe(k, depth + 1, true, out);
        out += " = ";
        Describe(val, depth + 1, true, out);
        out += ";\n";
      }
      out += pad + "}";
      return;
    }
  }
}

}  // namespace

std::string Value::Description() const {
  std::string out;
  Describe(*this, 0, false, out);
  return out;
}

void PrintTo(const Value& v, std::ostream* os) { *os << v.Description(); }

Value Value::MutableCopy() const {
  if (auto a = AsArray()) return a->MutableCopy();
  if (auto d = AsDictionary()) return d->MutableCopy();
  return *this;
}

Value Value::DeepCopy() const {
  if (auto a = AsArray()) {
    Array out;
    for (const Value& item : *a) out.Append(item.DeepCopy());
    return out;
  }
  if (auto d = AsDictionary()) {
    Dictionary out;
    out.Reserve(d->size());
    for (const auto& [k, v] : *d) out.AppendUnique(k.DeepCopy(), v.DeepCopy());
    return out;
  }
  return *this;
}

}  // namespace cf
