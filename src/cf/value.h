// Typed values shared by the whole system: null, boolean, number, string,
// data, date, array and dictionary.
//
// Arrays and dictionaries are handles to shared, mutable containers: copying
// a Value copies the handle, so a cache written into a dictionary is seen by
// everyone holding it. MutableCopy() makes a new container one level deep;
// DeepCopy() copies every nested container.
#pragma once

#include <cstddef>
#include <cstdint>
#include <iosfwd>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
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
  static Number UInt64(uint64_t v);
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
  const std::vector<std::pair<Value, Value>>& entries() const;
  std::vector<std::pair<Value, Value>>::const_iterator begin() const;
  std::vector<std::pair<Value, Value>>::const_iterator end() const;
  Dictionary MutableCopy() const;
  bool SameAs(const Dictionary& o) const { return impl_ == o.impl_; }

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
  Value() = default;
  Value(std::nullptr_t) {}
  Value(Number n) : v_(n) {}
  Value(const char* s) : v_(std::string(s)) {}
  Value(std::string s) : v_(std::move(s)) {}
  Value(std::string_view s) : v_(std::string(s)) {}
  Value(Date d) : v_(d) {}
  Value(Array a) : v_(std::move(a)) {}
  Value(Dictionary d) : v_(std::move(d)) {}
  static Value Bool(bool b) {
    Value v;
    v.v_ = b;
    return v;
  }
  static Value Bytes(Data d) {
    Value v;
    v.v_ = std::make_shared<const Data>(std::move(d));
    return v;
  }
  static Value SInt32(int32_t v) { return Number::SInt32(v); }
  static Value SInt64(int64_t v) { return Number::SInt64(v); }
  static Value UInt64(uint64_t v) { return Number::UInt64(v); }
  static Value Float64(double v) { return Number::Float64(v); }

  Type type() const { return static_cast<Type>(v_.index()); }
  bool IsNull() const { return type() == Type::kNull; }
  explicit operator bool() const { return !IsNull(); }

  // Borrowed views; null when the value has another type.
  const bool* AsBool() const { return std::get_if<bool>(&v_); }
  const Number* AsNumber() const { return std::get_if<Number>(&v_); }
  const std::string* AsString() const { return std::get_if<std::string>(&v_); }
  const Data* AsData() const;
  const Date* AsDate() const { return std::get_if<Date>(&v_); }
  const Array* AsArray() const { return std::get_if<Array>(&v_); }
  const Dictionary* AsDictionary() const { return std::get_if<Dictionary>(&v_); }

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
  std::variant<std::monostate, bool, Number, std::string, std::shared_ptr<const Data>, Date, Array,
               Dictionary>
      v_;
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
