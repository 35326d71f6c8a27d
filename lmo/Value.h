#pragma once
// The one value type of the system, shared by property lists and IPC
// messages: null, boolean, integer (signed or unsigned 64-bit, remembering
// which), real, string, data, date, UUID, array and dictionary.
//
// Values are immutable. Scalars are stored inline; strings, data, arrays and
// dictionaries share their nodes, so copying any Value is at most one
// reference-count increment. Operations that "change" an array or dictionary
// return a new one and leave the receiver as it was.
//
// Equality follows property-list rules: booleans and numbers compare by
// numeric value (true == 1, false == 0, 2 == 2.0, signed 5 == unsigned 5).

#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "base/Uuid.h"

namespace vantrel::lmo {

class Value;

// An immutable, shared list of values.
class Array {
 public:
  Array() = default;
  Array(std::vector<Value> items);
  Array(std::initializer_list<Value> items);

  size_t size() const;
  bool empty() const { return size() == 0; }
  // The element at i; a null value when i is out of range.
  const Value& at(size_t i) const;
  const Value& operator[](size_t i) const { return at(i); }
  const Value* begin() const;
  const Value* end() const;

  Array appending(Value v) const;
  bool operator==(const Array& other) const;

 private:
  std::shared_ptr<const std::vector<Value>> items_;  // null means empty
};

// An immutable, shared map from string keys to values, kept sorted by key so
// that lookups are binary searches and every output is deterministic.
class Dictionary {
 public:
  using Entry = std::pair<std::string, Value>;

  Dictionary() = default;
  Dictionary(std::initializer_list<Entry> entries);
  // Sorts the entries; for a key given twice the later entry wins.
  static Dictionary fromEntries(std::vector<Entry> entries);

  size_t size() const;
  bool empty() const { return size() == 0; }
  // The value under key, or nullptr when the key is absent.
  const Value* find(std::string_view key) const;
  // The value under key, or a null value when absent.
  const Value& get(std::string_view key) const;
  bool contains(std::string_view key) const { return find(key) != nullptr; }
  const Entry* begin() const;
  const Entry* end() const;
  std::vector<std::string> keys() const;

  // A copy in which key maps to v; a null v removes the key.
  Dictionary setting(std::string_view key, Value v) const;
  Dictionary removing(std::string_view key) const;

  bool operator==(const Dictionary& other) const;

 private:
  explicit Dictionary(std::shared_ptr<const std::vector<Entry>> entries)
      : entries_(std::move(entries)) {}
  std::shared_ptr<const std::vector<Entry>> entries_;  // null means empty
};

// Seconds since 1970-01-01 00:00:00 UTC.
struct Date {
  double secondsSince1970 = 0;
  auto operator<=>(const Date&) const = default;
};

class Value {
 public:
  enum class Type : uint8_t {
    kNull,
    kBoolean,
    kInteger,
    kReal,
    kString,
    kData,
    kDate,
    kUuid,
    kArray,
    kDictionary
  };
  using Bytes = std::vector<uint8_t>;

  Value() = default;  // null
  Value(std::nullptr_t) {}
  Value(const char* s);  // a null pointer gives a null value
  Value(std::string s);
  Value(std::string_view s) : Value(std::string(s)) {}
  Value(Array a) : v_(std::move(a)) {}
  Value(Dictionary d) : v_(std::move(d)) {}
  Value(const base::Uuid& u) : v_(u) {}
  Value(Date d) : v_(d) {}

  static Value boolean(bool b);
  static Value integer(int64_t i);
  static Value unsignedInteger(uint64_t u);
  static Value real(double d);
  static Value data(Bytes bytes);
  static Value data(const void* bytes, size_t size);

  Type type() const { return static_cast<Type>(v_.index()); }
  bool isNull() const { return type() == Type::kNull; }
  // Booleans, integers and reals: the family that compares numerically.
  bool isNumeric() const;
  // An integer that was made unsigned (for example a CBOR major type 0).
  bool isUnsignedInteger() const;

  // Typed reads: a pointer into this value when the type matches, else null.
  const bool* getIfBoolean() const { return std::get_if<bool>(&v_); }
  const double* getIfReal() const { return std::get_if<double>(&v_); }
  const std::string* getIfString() const;
  const Bytes* getIfData() const;
  const Date* getIfDate() const { return std::get_if<Date>(&v_); }
  const base::Uuid* getIfUuid() const { return std::get_if<base::Uuid>(&v_); }
  const Array* getIfArray() const { return std::get_if<Array>(&v_); }
  const Dictionary* getIfDictionary() const { return std::get_if<Dictionary>(&v_); }

  // Exact integer reads: the value when it is an integer (not a real, not a
  // boolean) that fits the target type, else nullopt.
  std::optional<int64_t> getIfInt64() const;
  std::optional<uint64_t> getIfUInt64() const;

  // Loose numeric reads with C conversion semantics, for the places where a
  // property list's "number value" is wanted: integers and reals convert
  // (reals truncate toward zero, out-of-range wraps as the target type
  // does), booleans are 0 or 1, anything else is 0.
  int64_t integerValue() const;
  uint64_t unsignedValue() const;
  double doubleValue() const;
  // The boolean value of a property-list object: a boolean itself; a number
  // that is not zero; a string whose first non-blank character (after an
  // optional sign) is Y, y, T, t or a digit 1-9. Anything else is false.
  bool boolValue() const;

  bool operator==(const Value& other) const;

 private:
  struct Integer {
    uint64_t bits;
    bool isUnsigned;
  };
  using String = std::shared_ptr<const std::string>;
  using Data = std::shared_ptr<const Bytes>;
  // Order matches Type.
  std::variant<std::monostate, bool, Integer, double, String, Data, Date, base::Uuid, Array,
               Dictionary>
      v_;
};

// Printable description for log lines. A string describes as its own text;
// inside arrays and dictionaries strings are quoted when they hold anything
// but letters, digits and ._-/ characters.
std::string describe(const Value& v);
std::string describe(const Array& a);
std::string describe(const Dictionary& d);

const char* typeName(Value::Type t);

}  // namespace vantrel::lmo
