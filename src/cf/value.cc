#include "cf/value.h"

#include "cf/bytes.h"

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
// The two halves of a 128-bit product folded together: every bit of both
// factors reaches the low bits the index uses.
inline uint64_t MulFold(uint64_t a, uint64_t b) {
  const unsigned __int128 r = static_cast<unsigned __int128>(a) * b;
  return static_cast<uint64_t>(r) ^ static_cast<uint64_t>(r >> 64);
}

// Sixteen bytes at a time through one wide multiply; the last sixteen (or
// all of a shorter text) are read as two words that may overlap, which
// with the length mixed in tells every text apart before the multiply.
// Names of a few dozen characters take two or three multiplies, one after
// the other.
inline uint32_t HashBytes(const char* p, size_t n) {
  constexpr uint64_t k0 = 0x9e3779b97f4a7c15ULL, k1 = 0xc2b2ae3d27d4eb4fULL, k2 = 0x165667b19e3779f9ULL;
  uint64_t seed = k0 ^ n, a = 0, b = 0;
  if (n > 16) {
    size_t left = n;
    while (left > 16) {
      seed = MulFold(Load8(p) ^ k1, Load8(p + 8) ^ seed);
      p += 16;
      left -= 16;
    }
    a = Load8(p + left - 16);
    b = Load8(p + left - 8);
  } else if (n >= 8) {
    a = Load8(p);
    b = Load8(p + n - 8);
  } else if (n >= 4) {
    a = Load4(p);
    b = Load4(p + n - 4);
  } else if (n > 0) {
    a = static_cast<uint64_t>(static_cast<unsigned char>(p[0])) |
        static_cast<uint64_t>(static_cast<unsigned char>(p[n / 2])) << 8 |
        static_cast<uint64_t>(static_cast<unsigned char>(p[n - 1])) << 16;
  }
  const uint64_t h = MulFold(a ^ k2, b ^ seed);
  return static_cast<uint32_t>(h ^ (h >> 32));
}

internal::TextBlock* NewTextBlock(size_t characters, size_t references) {
  void* memory = ::operator new(sizeof(internal::TextBlock) + characters);
  return new (memory) internal::TextBlock{references};
}

char* TextOf(internal::TextBlock* block) { return reinterpret_cast<char*>(block + 1); }

using internal::StoreRep;
using internal::Words;

// Up to 15 characters and the zeros after them, as two little-endian words
// read from the text without reading past it.
[[gnu::always_inline]] inline Words LocalWords(const char* p, size_t n) {
  uint64_t lo = 0, hi = 0;
  if (n >= 8) {
    // The last word read holds characters 8 and on in its top n - 8 bytes;
    // shifting in two steps makes n == 8 give zero.
    lo = Load8(p);
    hi = Load8(p + n - 8) >> (8 * (15 - n)) >> 8;
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
  SetHead(text.size(), HashBytes(text.data(), text.size()));
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

[[gnu::always_inline]] inline String::String(Short, std::string_view text, size_t hash) noexcept {
  SetHead(text.size(), hash);
  StoreRep(rep_, LocalWords(text.data(), text.size()));
}

void String::Release(internal::TextBlock* block, size_t n) noexcept {
  if (block->references.fetch_sub(n, std::memory_order_acq_rel) == n) {
    block->~TextBlock();
    ::operator delete(block);
  }
}

std::ostream& operator<<(std::ostream& os, const String& s) { return os << s.view(); }



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

// A dictionary's entries in one block, like a vector of them, but dropped
// in a single pass: the references of keys made in the same text block go
// back one run at a time instead of one atomic step per key, and plain
// values cost a test each.
class EntryStore {
 public:
  using Entry = std::pair<Value, Value>;
  EntryStore() = default;
  EntryStore(const EntryStore& o) { *this = o; }
  EntryStore& operator=(const EntryStore& o) {
    if (this == &o) return *this;
    clear();
    reserve(o.size_);
    for (const Entry& e : o) emplace_back(e.first, e.second);
    return *this;
  }
  ~EntryStore() {
    DropAll();
    ::operator delete(data_);
  }

  size_t size() const { return size_; }
  Entry* data() { return data_; }
  const Entry* data() const { return data_; }
  Entry& operator[](size_t i) { return data_[i]; }
  const Entry& operator[](size_t i) const { return data_[i]; }
  const Entry* begin() const { return data_; }
  const Entry* end() const { return data_ + size_; }

  void reserve(size_t n) {
    if (n <= capacity_) return;
    auto* moved = static_cast<Entry*>(::operator new(n * sizeof(Entry)));
    for (size_t i = 0; i < size_; ++i) {
      new (&moved[i]) Entry(std::move(data_[i]));
      data_[i].~Entry();
    }
    ::operator delete(data_);
    data_ = moved;
    capacity_ = n;
  }
  // A new entry of two null values, in room reserved before: the caller
  // makes its parts in place.
  Entry& AppendReserved() { return *new (&data_[size_++]) Entry(); }
  template <typename K, typename V>
  void emplace_back(K&& key, V&& value) {
    if (size_ == capacity_) reserve(std::max<size_t>(8, capacity_ * 2));
    new (&data_[size_]) Entry(std::forward<K>(key), std::forward<V>(value));
    ++size_;
  }
  void erase(size_t i) {
    for (size_t j = i + 1; j < size_; ++j) data_[j - 1] = std::move(data_[j]);
    data_[--size_].~Entry();
  }
  void clear() {
    DropAll();
    size_ = 0;
  }

 private:
  void DropAll() {
    internal::TextBlock* run = nullptr;
    size_t n = 0;
    Entry* const data = data_;
    for (size_t i = 0, size = size_; i < size; ++i) {
      Value& key = data[i].first;
      if (key.type_ == Type::kString) {
        // The string ends without its destructor: an inline one holds
        // nothing, a shared one's reference goes back with its run.
        const String& text = key.u_.string;
        if (text.IsShared()) {
          if (text.rep_.shared.block != run) {
            if (run) String::Release(run, n);
            run = text.rep_.shared.block;
            n = 0;
          }
          ++n;
        }
      } else if (!Value::IsPlain(key.type_)) {
        key.Destroy();
      }
      Value& value = data[i].second;
      if (!Value::IsPlain(value.type_)) value.Destroy();
    }
    if (run) String::Release(run, n);
  }

  Entry* data_ = nullptr;
  size_t size_ = 0;
  size_t capacity_ = 0;
};

class DictionaryImpl {
 public:
  EntryStore entries;
  std::vector<uint32_t> hashes;  // of the keys, folded to 32 bits by IndexHash
  // Open-addressing index into entries (slot value = index + 1); built only
  // once the dictionary is large enough for a linear scan to hurt.
  std::vector<uint32_t> slots;

  static constexpr size_t kIndexThreshold = 12;

  static uint32_t IndexHash(const Value& key) {
    const size_t h = key.Hash();
    return static_cast<uint32_t>(h ^ (h >> 32));
  }

  // Where key is (index into entries), or -1 and, when indexed, the free
  // slot where it would go.
  long FindIndex(const Value& key, uint32_t h, size_t* free_slot = nullptr) const {
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
  long FindIndex(const Value& key) const { return FindIndex(key, IndexHash(key)); }

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
  void Append(Value&& key, Value&& value, uint32_t h, const size_t* free_slot = nullptr) {
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
  const uint32_t h = DictionaryImpl::IndexHash(key);
  size_t free_slot = 0;
  const long i = impl_->FindIndex(key, h, &free_slot);
  if (i >= 0) {
    impl_->entries[static_cast<size_t>(i)].second = std::move(value);
    return;
  }
  impl_->Append(std::move(key), std::move(value), h, impl_->slots.empty() ? nullptr : &free_slot);
}
void Dictionary::AppendUnique(Value key, Value value) {
  const uint32_t h = DictionaryImpl::IndexHash(key);
  impl_->Append(std::move(key), std::move(value), h);
}
void Dictionary::Remove(const Value& key) {
  const long i = impl_->FindIndex(key);
  if (i < 0) return;
  impl_->entries.erase(static_cast<size_t>(i));
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
std::span<const std::pair<Value, Value>> Dictionary::entries() const {
  return {impl_->entries.begin(), impl_->entries.size()};
}
const std::pair<Value, Value>* Dictionary::begin() const { return impl_->entries.begin(); }
const std::pair<Value, Value>* Dictionary::end() const { return impl_->entries.end(); }
Dictionary Dictionary::Of(std::initializer_list<std::pair<const char*, Value>> entries) {
  Dictionary d;
  for (const auto& [k, v] : entries) d.Set(k, v);
  return d;
}

Dictionary Dictionary::OfUnsigned(const NamedUnsigned* pairs, size_t count) {
  Dictionary out;
  if (count == 0) return out;
  DictionaryImpl& d = *out.impl_;
  size_t capacity = 16;
  while (capacity < count * 2) capacity <<= 1;
  d.slots.assign(capacity, 0);
  // Sized for every pair at once and cut to the entries kept at the end:
  // writing through a pointer spares each entry the checks of an append.
  d.hashes.resize(count);
  d.entries.reserve(count);
  std::pair<Value, Value>* const entries = d.entries.data();
  uint32_t* const hashes = d.hashes.data();
  size_t kept = 0;
  // The long names go into blocks that start at an estimate and double;
  // a block learns how many keys hold it once it is full or the last.
  internal::TextBlock* block = nullptr;
  char *cursor = nullptr, *block_end = nullptr;
  size_t block_size = count * 24 + 256, block_keys = 0;
  auto close_block = [&] {
    if (block) block->references.store(block_keys, std::memory_order_relaxed);
  };
  uint32_t* const slots = d.slots.data();
  const size_t mask = capacity - 1;
  // The entries and the index in one pass. Each name is hashed a few
  // names ahead of its turn and its slot asked for then, so that the hash
  // and the slot's wait overlap the work on the names before it; a
  // repeated name only replaces a value, so the hashes close up behind the
  // entries kept.
  constexpr size_t kAhead = 8;  // a power of two
  uint32_t ahead[kAhead];
  auto look_ahead = [&](size_t i) {
    const uint32_t h = HashBytes(pairs[i].name.data(), pairs[i].name.size());
    ahead[i % kAhead] = h;
    __builtin_prefetch(&slots[h & mask]);
  };
  for (size_t i = 0; i < count && i < kAhead; ++i) look_ahead(i);
  for (size_t i = 0; i < count; ++i) {
    const uint32_t h = ahead[i % kAhead];
    if (i + kAhead < count) look_ahead(i + kAhead);
    const std::string_view name = pairs[i].name;
    size_t s = h & mask;
    bool repeated = false;
    for (uint32_t slot; (slot = slots[s]) != 0; s = (s + 1) & mask) {
      const size_t j = slot - 1;
      if (hashes[j] == h && entries[j].first.StringView() == name) {
        entries[j].second = Value(Number::UInt64(pairs[i].value));
        repeated = true;
        break;
      }
    }
    if (repeated) continue;
    slots[s] = static_cast<uint32_t>(kept + 1);
    hashes[kept] = h;
    // The key's parts go straight into the new entry.
    auto& entry = d.entries.AppendReserved();
    ++kept;
    new (&entry.second) Value(Number::UInt64(pairs[i].value));
    if (name.size() > String::kLocalCapacity) {
      if (static_cast<size_t>(block_end - cursor) <= name.size()) {
        close_block();  // first: the keys made so far hold it whatever happens next
        if (name.size() > std::numeric_limits<uint32_t>::max()) throw std::length_error("cf::String too long");
        block_size = std::max(block ? block_size * 2 : block_size, name.size() + 1);
        block = NewTextBlock(block_size, 0);
        block_keys = 0;
        cursor = TextOf(block);
        block_end = cursor + block_size;
      }
      CopyShort(cursor, name.data(), name.size());
      cursor[name.size()] = 0;
      new (entry.first.StartString()) String(block, cursor, name.size(), h);
      cursor += name.size() + 1;
      ++block_keys;
    } else {
      new (entry.first.StartString()) String(String::Short(), name, h);
    }
  }
  close_block();
  d.hashes.resize(kept);
  if (kept < DictionaryImpl::kIndexThreshold) d.slots.clear();
  return out;
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

void Value::CopyFrom(const Value& o) {
  switch (o.type_) {
    case Type::kString: new (&u_.string) String(o.u_.string); break;
    case Type::kData: new (&u_.data) std::shared_ptr<const Data>(o.u_.data); break;
    case Type::kArray: new (&u_.array) Array(o.u_.array); break;
    case Type::kDictionary: new (&u_.dictionary) Dictionary(o.u_.dictionary); break;
    default: std::memcpy(static_cast<void*>(&u_), &o.u_, sizeof u_); break;
  }
  type_ = o.type_;
}

void Value::Destroy() noexcept {
  switch (type_) {
    case Type::kString: u_.string.~String(); break;
    case Type::kData: u_.data.~shared_ptr(); break;
    case Type::kArray: u_.array.~Array(); break;
    case Type::kDictionary: u_.dictionary.~Dictionary(); break;
    default: break;
  }
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
