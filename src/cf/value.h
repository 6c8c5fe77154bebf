// Typed values shared by the whole system: null, boolean, number, string,
// data, date, array and dictionary.
//
// Arrays and dictionaries are handles to shared, mutable containers: copying
// a Value copies the handle, so a cache written into a dictionary is seen by
// everyone holding it. MutableCopy() makes a new container one level deep;
// DeepCopy() copies every nested container.
//
// Strings are immutable. Short ones live in the Value; longer ones hold a
// counted reference on shared bytes, so copying a string never copies its
// characters, and each string carries its hash.
#pragma once

#include <atomic>
#include <cstddef>
#include <compare>
#include <cstdint>
#include <cstring>
#include <initializer_list>
#include <iosfwd>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <new>
#include <vector>

namespace cf {

// Number type codes. The first nine are the platform's own codes; the
// unsigned 64-bit kind has no platform code and gets one of its own.
enum class NumberType : int {
  kSInt8 = 1,
  kSInt16 = 2,
  kSInt32 = 3,
  kSInt64 = 4,
  kFloat32 = 5,
  kFloat64 = 6,
  kInt = 9,
  kFloat = 12,
  kDouble = 13,
  kUInt64 = 100,
};

// A number that remembers the type it was made with. Reading it as another
// type follows C's conversions: integer to narrower integer keeps the low
// bits, floating to integer truncates toward zero (saturating outside the
// target's range, NaN gives 0), integer to floating converts.
class Number {
 public:
  Number() = default;
  static Number Make(NumberType type, int64_t v);
  static Number MakeDouble(NumberType type, double v);
  static Number SInt8(int8_t v) { return Make(NumberType::kSInt8, v); }
  static Number SInt16(int16_t v) { return Make(NumberType::kSInt16, v); }
  static Number SInt32(int32_t v) { return Make(NumberType::kSInt32, v); }
  static Number SInt64(int64_t v) { return Make(NumberType::kSInt64, v); }
  static Number UInt64(uint64_t v) {
    Number n;
    n.type_ = NumberType::kUInt64;
    n.bits_ = v;
    return n;
  }
  static Number Float32(float v) { return MakeDouble(NumberType::kFloat32, v); }
  static Number Float64(double v) { return MakeDouble(NumberType::kFloat64, v); }

  NumberType type() const { return type_; }
  bool IsFloat() const;
  bool IsUnsigned() const { return type_ == NumberType::kUInt64; }

  int8_t AsSInt8() const { return static_cast<int8_t>(AsSInt64()); }
  int16_t AsSInt16() const { return static_cast<int16_t>(AsSInt64()); }
  int32_t AsSInt32() const { return static_cast<int32_t>(AsSInt64()); }
  int64_t AsSInt64() const;
  uint32_t AsUInt32() const { return static_cast<uint32_t>(AsUInt64()); }
  uint64_t AsUInt64() const;
  float AsFloat32() const { return static_cast<float>(AsFloat64()); }
  double AsFloat64() const;

  // Value comparison across types: 3 (int) equals 3.0 (double), and the
  // unsigned 2^64-1 is not the signed -1.
  bool operator==(const Number& o) const;
  int Compare(const Number& o) const;
  size_t Hash() const;
  std::string Description() const;

 private:
  NumberType type_ = NumberType::kSInt64;
  // Integers live in bits_ (two's complement for signed kinds); floating
  // kinds live in real_ (a float already rounded to float precision).
  uint64_t bits_ = 0;
  double real_ = 0;
};

// A point in time, as seconds since 1970-01-01T00:00:00Z.
struct Date {
  double seconds = 0;
  bool operator==(const Date& o) const { return seconds == o.seconds; }
};

class Value;
class ArrayImpl;
class DictionaryImpl;
class EntryStore;

namespace internal {
// Counted bytes shared by the strings made in them; the characters follow.
struct TextBlock {
  std::atomic<size_t> references;
};

// The 16 bytes of a string's representation, written with one store: a new
// string is usually moved at once, and a 16-byte load of bytes that narrower
// stores have just written waits for them to reach the cache.
using Words = uint64_t __attribute__((vector_size(16)));
template <typename Rep>
inline void StoreRep(Rep& rep, Words words) {
  static_assert(sizeof(Rep) == sizeof(Words));
  std::memcpy(&rep, &words, sizeof words);
}
}  // namespace internal

// An immutable string. Up to 15 characters are held inline; longer texts
// point into a TextBlock whose reference count the string holds, so copies
// share the bytes. The text is always followed by a NUL (c_str()). Safe to
// copy and drop from several threads: the count is atomic and the bytes
// never change.
class String {
 public:
  String() noexcept {
    SetHead(0, HashOfEmpty());
    rep_.local[0] = 0;
  }
  explicit String(std::string_view text);
  explicit String(const char* text) : String(std::string_view(text)) {}
  explicit String(const std::string& text) : String(std::string_view(text)) {}
  String(const String& o) noexcept : head_(o.head_), rep_(o.rep_) {
    if (IsShared()) rep_.shared.block->references.fetch_add(1, std::memory_order_relaxed);
  }
  String(String&& o) noexcept : head_(o.head_), rep_(o.rep_) { o.ForgetBlock(); }
  String& operator=(const String& o) noexcept {
    String copy(o);
    Swap(copy);
    return *this;
  }
  String& operator=(String&& o) noexcept {
    String moved(std::move(o));
    Swap(moved);
    return *this;
  }
  ~String() {
    if (IsShared()) Release(rep_.shared.block, 1);
  }

  const char* data() const { return IsShared() ? rep_.shared.data : rep_.local; }
  const char* c_str() const { return data(); }
  size_t size() const { return head_.size; }
  size_t length() const { return head_.size; }
  bool empty() const { return head_.size == 0; }
  std::string_view view() const { return {data(), head_.size}; }
  std::string str() const { return std::string(view()); }
  operator std::string_view() const { return view(); }
  operator std::string() const { return str(); }
  size_t hash() const { return head_.hash; }
  // Reading as a std::string would.
  static constexpr size_t npos = std::string_view::npos;
  char operator[](size_t i) const { return data()[i]; }
  const char* begin() const { return data(); }
  const char* end() const { return data() + head_.size; }
  size_t find(std::string_view s, size_t pos = 0) const { return view().find(s, pos); }
  size_t find(char c, size_t pos = 0) const { return view().find(c, pos); }
  size_t rfind(std::string_view s, size_t pos = npos) const { return view().rfind(s, pos); }
  size_t rfind(char c, size_t pos = npos) const { return view().rfind(c, pos); }
  friend std::string operator+(const String& a, std::string_view b) { return a.str().append(b); }
  friend std::string operator+(const String& a, const char* b) { return a.str().append(b); }
  friend std::string operator+(std::string a, const String& b) { return a.append(b.view()); }
  friend std::string operator+(const char* a, const String& b) { return std::string(a).append(b.view()); }
  // True when both hold the same shared bytes (not merely equal texts).
  bool SharesBytesWith(const String& o) const {
    return IsShared() && o.IsShared() && rep_.shared.block == o.rep_.shared.block && rep_.shared.data == o.rep_.shared.data;
  }

  friend bool operator==(const String& a, const String& b) {
    if (a.head_.size != b.head_.size || a.head_.hash != b.head_.hash) return false;
    return a.data() == b.data() || std::memcmp(a.data(), b.data(), a.head_.size) == 0;
  }
  friend bool operator==(const String& a, std::string_view b) { return a.view() == b; }
  friend bool operator==(const String& a, const char* b) { return a.view() == std::string_view(b); }
  friend bool operator==(const String& a, const std::string& b) { return a.view() == std::string_view(b); }
  friend auto operator<=>(const String& a, const String& b) { return a.view() <=> b.view(); }
  friend auto operator<=>(const String& a, std::string_view b) { return a.view() <=> b; }
  friend std::ostream& operator<<(std::ostream& os, const String& s);

  // The hash every string of these characters carries.
  static size_t HashOf(std::string_view text);

 private:
  friend class Dictionary;
  friend class EntryStore;
  static constexpr size_t kLocalCapacity = 15;  // plus the NUL

  bool IsShared() const { return head_.size > kLocalCapacity; }
  // A long text of known hash, already copied to data, whose reference on
  // block the new string takes over.
  String(internal::TextBlock* block, const char* data, size_t size, size_t hash) noexcept {
    SetHead(size, hash);
    internal::StoreRep(rep_, internal::Words{reinterpret_cast<uintptr_t>(block), reinterpret_cast<uintptr_t>(data)});
  }
  // A short text (kLocalCapacity characters at most) whose hash is known.
  struct Short {};
  String(Short, std::string_view text, size_t hash) noexcept;
  static size_t HashOfEmpty();
  // Leaves this an empty string without giving back its reference.
  void ForgetBlock() noexcept {
    head_.size = 0;
    rep_.local[0] = 0;
  }
  void Swap(String& o) noexcept {
    std::swap(head_, o.head_);
    std::swap(rep_, o.rep_);
  }
  static void Release(internal::TextBlock* block, size_t n) noexcept;

  // Size and hash are written together, by SetHead: copies read them as one
  // word, and a word read of two narrower stores waits for both.
  struct Head {
    uint32_t size;
    uint32_t hash;
  } head_;
  void SetHead(size_t size, size_t hash) noexcept {
    const uint64_t word = static_cast<uint32_t>(size) | static_cast<uint64_t>(static_cast<uint32_t>(hash)) << 32;
    std::memcpy(&head_, &word, sizeof word);
  }
  union Rep {
    struct {
      internal::TextBlock* block;
      const char* data;
    } shared;
    char local[kLocalCapacity + 1];
  } rep_;
};

// Shared handle to a mutable array. A default-constructed Array is a new,
// empty array.
class Array {
 public:
  Array();
  explicit Array(std::vector<Value> items);
  size_t size() const;
  bool empty() const { return size() == 0; }
  const Value& operator[](size_t i) const;
  const Value& at(size_t i) const;  // null Value when out of range
  void Append(Value v);
  void Set(size_t i, Value v);
  void RemoveAt(size_t i);
  void Clear();
  const std::vector<Value>& items() const;
  std::vector<Value>::const_iterator begin() const;
  std::vector<Value>::const_iterator end() const;
  Array MutableCopy() const;
  bool SameAs(const Array& o) const { return impl_ == o.impl_; }

 private:
  friend class Value;
  std::shared_ptr<ArrayImpl> impl_;
};

// A name and an unsigned 64-bit value: one entry of a bulk-built dictionary.
struct NamedUnsigned {
  std::string_view name;
  uint64_t value;
};

// Shared handle to a mutable dictionary that keeps insertion order. Keys are
// any value; replacing a key's value keeps its place.
class Dictionary {
 public:
  Dictionary();
  size_t size() const;
  bool empty() const { return size() == 0; }
  // Borrowed: null when absent.
  const Value* Find(const Value& key) const;
  // A null Value when absent. The reference stays valid until the dictionary changes.
  const Value& Get(const Value& key) const;
  bool Contains(const Value& key) const { return Find(key) != nullptr; }
  void Set(Value key, Value value);
  // Set without looking for an existing key; for builders that know the key
  // is new (a duplicate would shadow, so callers must be sure).
  void AppendUnique(Value key, Value value);
  void Remove(const Value& key);
  void Clear();
  void Reserve(size_t n);
  // In insertion order; valid until the dictionary changes.
  std::span<const std::pair<Value, Value>> entries() const;
  const std::pair<Value, Value>* begin() const;
  const std::pair<Value, Value>* end() const;
  Dictionary MutableCopy() const;
  bool SameAs(const Dictionary& o) const { return impl_ == o.impl_; }

  // The pairs, set in order (a later key replaces an earlier one's value).
  static Dictionary Of(std::initializer_list<std::pair<const char*, Value>> entries);
  // The dictionary Set would leave, called with each pair in order on an
  // empty one: string keys, unsigned 64-bit numbers, a later name replacing
  // the earlier value in its place. Built in passes rather than pair by
  // pair, with every key's characters in one shared block.
  static Dictionary OfUnsigned(const NamedUnsigned* pairs, size_t count);

 private:
  friend class Value;
  std::shared_ptr<DictionaryImpl> impl_;
};

using Data = std::vector<uint8_t>;

enum class Type { kNull, kBoolean, kNumber, kString, kData, kDate, kArray, kDictionary };

const char* TypeName(Type t);
// "a number", "an array": for messages.
std::string TypeNameWithArticle(Type t);

class Value {
 public:
  Value() noexcept {}
  Value(std::nullptr_t) noexcept {}
  Value(Number n) noexcept : type_(Type::kNumber) { new (&u_.number) Number(n); }
  Value(const char* s) : Value(String(s)) {}
  Value(const std::string& s) : Value(String(s)) {}
  Value(std::string_view s) : Value(String(s)) {}
  Value(String s) noexcept : type_(Type::kString) { new (&u_.string) String(std::move(s)); }
  Value(Date d) noexcept : type_(Type::kDate) { new (&u_.date) Date(d); }
  Value(Array a) noexcept : type_(Type::kArray) { new (&u_.array) Array(std::move(a)); }
  Value(Dictionary d) noexcept : type_(Type::kDictionary) { new (&u_.dictionary) Dictionary(std::move(d)); }
  static Value Bool(bool b) {
    Value v;
    v.type_ = Type::kBoolean;
    v.u_.boolean = b;
    return v;
  }
  static Value Bytes(Data d) {
    Value v;
    new (&v.u_.data) std::shared_ptr<const Data>(std::make_shared<const Data>(std::move(d)));
    v.type_ = Type::kData;
    return v;
  }
  static Value SInt32(int32_t v) { return Number::SInt32(v); }
  static Value SInt64(int64_t v) { return Number::SInt64(v); }
  static Value UInt64(uint64_t v) { return Number::UInt64(v); }
  static Value Float64(double v) { return Number::Float64(v); }

  Value(const Value& o) { CopyFrom(o); }
  Value(Value&& o) noexcept { MoveFrom(o); }
  Value& operator=(const Value& o) {
    if (this != &o) {
      Value copy(o);
      Reset();
      MoveFrom(copy);
    }
    return *this;
  }
  Value& operator=(Value&& o) noexcept {
    if (this != &o) {
      Reset();
      MoveFrom(o);
    }
    return *this;
  }
  ~Value() {
    if (!IsPlain(type_)) Destroy();
  }

  Type type() const { return type_; }
  bool IsNull() const { return type_ == Type::kNull; }
  explicit operator bool() const { return !IsNull(); }

  // Borrowed views; null when the value has another type.
  const bool* AsBool() const { return type_ == Type::kBoolean ? &u_.boolean : nullptr; }
  const Number* AsNumber() const { return type_ == Type::kNumber ? &u_.number : nullptr; }
  const String* AsString() const { return type_ == Type::kString ? &u_.string : nullptr; }
  // The characters of a string; empty for other types.
  std::string_view StringView() const {
    const String* s = AsString();
    return s ? s->view() : std::string_view();
  }
  const Data* AsData() const { return type_ == Type::kData ? u_.data.get() : nullptr; }
  const Date* AsDate() const { return type_ == Type::kDate ? &u_.date : nullptr; }
  const Array* AsArray() const { return type_ == Type::kArray ? &u_.array : nullptr; }
  const Dictionary* AsDictionary() const { return type_ == Type::kDictionary ? &u_.dictionary : nullptr; }

  bool operator==(const Value& o) const;
  bool operator!=(const Value& o) const { return !(*this == o); }
  size_t Hash() const;

  // The text of %@.
  std::string Description() const;

  // A new container one level deep (other kinds are returned as they are).
  Value MutableCopy() const;
  // A new container with every nested container copied too.
  Value DeepCopy() const;

 private:
  friend class Dictionary;
  friend class EntryStore;

  // Kinds with nothing to give back: copied and dropped as plain bytes.
  static constexpr bool IsPlain(Type t) {
    constexpr unsigned kPlain = 1u << static_cast<int>(Type::kNull) | 1u << static_cast<int>(Type::kBoolean) |
                                1u << static_cast<int>(Type::kNumber) | 1u << static_cast<int>(Type::kDate);
    return kPlain >> static_cast<int>(t) & 1;
  }
  // A string built in place, for builders that make the string's parts
  // themselves.
  String* StartString() {
    type_ = Type::kString;
    return &u_.string;
  }
  void CopyFrom(const Value& o);
  // Takes what o holds; o keeps a moved-from value of its kind.
  void MoveFrom(Value& o) noexcept {
    switch (o.type_) {
      case Type::kString: new (&u_.string) String(std::move(o.u_.string)); break;
      case Type::kData: new (&u_.data) std::shared_ptr<const Data>(std::move(o.u_.data)); break;
      case Type::kArray: new (&u_.array) Array(std::move(o.u_.array)); break;
      case Type::kDictionary: new (&u_.dictionary) Dictionary(std::move(o.u_.dictionary)); break;
      default: std::memcpy(static_cast<void*>(&u_), &o.u_, sizeof u_); break;
    }
    type_ = o.type_;
  }
  void Reset() noexcept {
    if (!IsPlain(type_)) Destroy();
    type_ = Type::kNull;
  }
  void Destroy() noexcept;

  Type type_ = Type::kNull;
  union Storage {
    Storage() {}
    ~Storage() {}
    bool boolean;
    Number number;
    String string;
    std::shared_ptr<const Data> data;
    Date date;
    Array array;
    Dictionary dictionary;
  } u_;
};

struct ValueHash {
  size_t operator()(const Value& v) const { return v.Hash(); }
};

// For test failure messages.
void PrintTo(const Value& v, std::ostream* os);

// Text of a date as the system prints it: "2026-11-22 10:00:00 +0000".
std::string DateDescription(const Date& d);
// A date in UTC to whole seconds: "2026-11-22T10:00:00Z" (ISO 8601) or
// "2026-11-22 10:00:00 +0000".
std::string FormatUTC(const Date& d, bool iso8601);

}  // namespace cf
