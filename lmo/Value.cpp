#include "lmo/Value.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <cmath>
#include <cstring>
#include <ctime>

namespace vantrel::lmo {
namespace {

const Value& nullValue() {
  static const Value v;
  return v;
}

}  // namespace

// ---- Array ----

Array::Array(std::vector<Value> items) {
  if (!items.empty()) items_ = std::make_shared<const std::vector<Value>>(std::move(items));
}

Array::Array(std::initializer_list<Value> items) : Array(std::vector<Value>(items)) {}

size_t Array::size() const {
  return items_ ? items_->size() : 0;
}

const Value& Array::at(size_t i) const {
  return i < size() ? (*items_)[i] : nullValue();
}

const Value* Array::begin() const {
  return items_ ? items_->data() : nullptr;
}

const Value* Array::end() const {
  return items_ ? items_->data() + items_->size() : nullptr;
}

Array Array::appending(Value v) const {
  std::vector<Value> items(begin(), end());
  items.push_back(std::move(v));
  return Array(std::move(items));
}

bool Array::operator==(const Array& other) const {
  if (items_ == other.items_) return true;
  return std::equal(begin(), end(), other.begin(), other.end());
}

// ---- Dictionary ----

Dictionary::Dictionary(std::initializer_list<Entry> entries)
    : Dictionary(fromEntries(std::vector<Entry>(entries))) {}

Dictionary Dictionary::fromEntries(std::vector<Entry> entries) {
  if (entries.empty()) return Dictionary();
  // What peers and files send is usually in key order already (our own
  // encoders write it so): then there is nothing to sort or merge.
  const auto outOfOrder =
      std::adjacent_find(entries.begin(), entries.end(),
                         [](const Entry& a, const Entry& b) { return !(a.first < b.first); });
  if (outOfOrder == entries.end()) {
    return Dictionary(std::make_shared<const std::vector<Entry>>(std::move(entries)));
  }
  // Stable sort keeps the given order among equal keys, so the last of them
  // is the one to keep.
  std::stable_sort(entries.begin(), entries.end(),
                   [](const Entry& a, const Entry& b) { return a.first < b.first; });
  std::vector<Entry> unique;
  unique.reserve(entries.size());
  for (auto& e : entries) {
    if (!unique.empty() && unique.back().first == e.first) {
      unique.back().second = std::move(e.second);
    } else {
      unique.push_back(std::move(e));
    }
  }
  return Dictionary(std::make_shared<const std::vector<Entry>>(std::move(unique)));
}

size_t Dictionary::size() const {
  return entries_ ? entries_->size() : 0;
}

const Dictionary::Entry* Dictionary::begin() const {
  return entries_ ? entries_->data() : nullptr;
}

const Dictionary::Entry* Dictionary::end() const {
  return entries_ ? entries_->data() + entries_->size() : nullptr;
}

const Value* Dictionary::find(std::string_view key) const {
  const Entry* first = begin();
  const Entry* last = end();
  const Entry* it = std::lower_bound(
      first, last, key, [](const Entry& e, std::string_view k) { return e.first < k; });
  if (it != last && it->first == key) return &it->second;
  return nullptr;
}

const Value& Dictionary::get(std::string_view key) const {
  const Value* v = find(key);
  return v ? *v : nullValue();
}

std::vector<std::string> Dictionary::keys() const {
  std::vector<std::string> out;
  out.reserve(size());
  for (const Entry& e : *this) out.push_back(e.first);
  return out;
}

Dictionary Dictionary::setting(std::string_view key, Value v) const {
  if (v.isNull()) return removing(key);
  std::vector<Entry> entries(begin(), end());
  auto it = std::lower_bound(entries.begin(), entries.end(), key,
                             [](const Entry& e, std::string_view k) { return e.first < k; });
  if (it != entries.end() && it->first == key) {
    it->second = std::move(v);
  } else {
    entries.insert(it, Entry(std::string(key), std::move(v)));
  }
  return Dictionary(std::make_shared<const std::vector<Entry>>(std::move(entries)));
}

Dictionary Dictionary::removing(std::string_view key) const {
  if (!contains(key)) return *this;
  std::vector<Entry> entries;
  entries.reserve(size() - 1);
  for (const Entry& e : *this) {
    if (e.first != key) entries.push_back(e);
  }
  if (entries.empty()) return Dictionary();
  return Dictionary(std::make_shared<const std::vector<Entry>>(std::move(entries)));
}

bool Dictionary::operator==(const Dictionary& other) const {
  if (entries_ == other.entries_) return true;
  return std::equal(begin(), end(), other.begin(), other.end());
}

// ---- Value ----

Value::Value(const char* s) {
  if (s != nullptr) v_ = std::make_shared<const std::string>(s);
}

Value::Value(std::string s) : v_(std::make_shared<const std::string>(std::move(s))) {}

Value Value::boolean(bool b) {
  Value v;
  v.v_ = b;
  return v;
}

Value Value::integer(int64_t i) {
  Value v;
  v.v_ = Integer{static_cast<uint64_t>(i), false};
  return v;
}

Value Value::unsignedInteger(uint64_t u) {
  Value v;
  v.v_ = Integer{u, true};
  return v;
}

Value Value::real(double d) {
  Value v;
  v.v_ = d;
  return v;
}

Value Value::data(Bytes bytes) {
  Value v;
  v.v_ = std::make_shared<const Bytes>(std::move(bytes));
  return v;
}

Value Value::data(const void* bytes, size_t size) {
  const auto* p = static_cast<const uint8_t*>(bytes);
  return data(Bytes(p, p + size));
}

bool Value::isNumeric() const {
  Type t = type();
  return t == Type::kBoolean || t == Type::kInteger || t == Type::kReal;
}

bool Value::isUnsignedInteger() const {
  const Integer* i = std::get_if<Integer>(&v_);
  return i != nullptr && i->isUnsigned;
}

const std::string* Value::getIfString() const {
  const String* s = std::get_if<String>(&v_);
  return s ? s->get() : nullptr;
}

const Value::Bytes* Value::getIfData() const {
  const Data* d = std::get_if<Data>(&v_);
  return d ? d->get() : nullptr;
}

std::optional<int64_t> Value::getIfInt64() const {
  const Integer* i = std::get_if<Integer>(&v_);
  if (i == nullptr) return std::nullopt;
  if (i->isUnsigned && i->bits > static_cast<uint64_t>(INT64_MAX)) return std::nullopt;
  return static_cast<int64_t>(i->bits);
}

std::optional<uint64_t> Value::getIfUInt64() const {
  const Integer* i = std::get_if<Integer>(&v_);
  if (i == nullptr) return std::nullopt;
  if (!i->isUnsigned && static_cast<int64_t>(i->bits) < 0) return std::nullopt;
  return i->bits;
}

namespace {

// Truncates a real toward zero into a 64-bit pattern without undefined
// behaviour for NaN or out-of-range values.
uint64_t truncateBits(double d) {
  if (std::isnan(d)) return 0;
  if (d >= 0) {
    if (d >= 18446744073709551616.0) return UINT64_MAX;
    return static_cast<uint64_t>(d);
  }
  if (d <= -9223372036854775808.0) return static_cast<uint64_t>(INT64_MIN);
  return static_cast<uint64_t>(static_cast<int64_t>(d));
}

}  // namespace

int64_t Value::integerValue() const {
  return static_cast<int64_t>(unsignedValue());
}

uint64_t Value::unsignedValue() const {
  switch (type()) {
    case Type::kBoolean:
      return std::get<bool>(v_) ? 1 : 0;
    case Type::kInteger:
      return std::get<Integer>(v_).bits;
    case Type::kReal:
      return truncateBits(std::get<double>(v_));
    default:
      return 0;
  }
}

double Value::doubleValue() const {
  switch (type()) {
    case Type::kBoolean:
      return std::get<bool>(v_) ? 1 : 0;
    case Type::kInteger: {
      const Integer& i = std::get<Integer>(v_);
      return i.isUnsigned ? static_cast<double>(i.bits)
                          : static_cast<double>(static_cast<int64_t>(i.bits));
    }
    case Type::kReal:
      return std::get<double>(v_);
    default:
      return 0;
  }
}

bool Value::boolValue() const {
  switch (type()) {
    case Type::kBoolean:
      return std::get<bool>(v_);
    case Type::kInteger:
      return std::get<Integer>(v_).bits != 0;
    case Type::kReal:
      return std::get<double>(v_) != 0;
    case Type::kString: {
      const std::string& s = *getIfString();
      size_t i = 0;
      while (i < s.size() && std::isspace(static_cast<unsigned char>(s[i]))) ++i;
      if (i < s.size() && (s[i] == '+' || s[i] == '-')) ++i;
      while (i < s.size() && s[i] == '0') ++i;
      if (i == s.size()) return false;
      char c = s[i];
      return c == 'Y' || c == 'y' || c == 'T' || c == 't' || (c >= '1' && c <= '9');
    }
    default:
      return false;
  }
}

namespace {

// A numeric value widened so that every int64, uint64 and double compares
// exactly: long double on x86-64 has a 64-bit mantissa.
long double numericKey(const Value& v) {
  switch (v.type()) {
    case Value::Type::kBoolean:
      return *v.getIfBoolean() ? 1 : 0;
    case Value::Type::kReal:
      return *v.getIfReal();
    default:
      if (v.isUnsignedInteger()) return static_cast<long double>(v.unsignedValue());
      return static_cast<long double>(v.integerValue());
  }
}

}  // namespace

bool Value::operator==(const Value& other) const {
  if (isNumeric() && other.isNumeric()) {
    if (type() == Type::kInteger && other.type() == Type::kInteger) {
      const Integer& a = std::get<Integer>(v_);
      const Integer& b = std::get<Integer>(other.v_);
      if (a.isUnsigned == b.isUnsigned) return a.bits == b.bits;
      // Mixed signedness: equal only when both are the same non-negative number.
      return a.bits == b.bits && static_cast<int64_t>(a.bits) >= 0;
    }
    return numericKey(*this) == numericKey(other);
  }
  if (type() != other.type()) return false;
  switch (type()) {
    case Type::kNull:
      return true;
    case Type::kString:
      return *getIfString() == *other.getIfString();
    case Type::kData:
      return *getIfData() == *other.getIfData();
    case Type::kDate:
      return *getIfDate() == *other.getIfDate();
    case Type::kUuid:
      return *getIfUuid() == *other.getIfUuid();
    case Type::kArray:
      return *getIfArray() == *other.getIfArray();
    case Type::kDictionary:
      return *getIfDictionary() == *other.getIfDictionary();
    default:
      return false;  // numeric types handled above
  }
}

// ---- Descriptions ----

namespace {

bool isPlainText(const std::string& s) {
  if (s.empty()) return false;
  return std::all_of(s.begin(), s.end(), [](char c) {
    return std::isalnum(static_cast<unsigned char>(c)) || c == '.' || c == '_' || c == '-' ||
           c == '/';
  });
}

void appendQuoted(std::string& out, const std::string& s) {
  if (isPlainText(s)) {
    out += s;
    return;
  }
  out += '"';
  for (char c : s) {
    switch (c) {
      case '"':
        out += "\\\"";
        break;
      case '\\':
        out += "\\\\";
        break;
      case '\n':
        out += "\\n";
        break;
      case '\t':
        out += "\\t";
        break;
      default:
        if (static_cast<unsigned char>(c) < 0x20) {
          char buf[8];
          std::snprintf(buf, sizeof buf, "\\u%04x", c);
          out += buf;
        } else {
          out += c;
        }
    }
  }
  out += '"';
}

void appendReal(std::string& out, double d) {
  if (std::isnan(d)) {
    out += "nan";
    return;
  }
  if (std::isinf(d)) {
    out += d > 0 ? "inf" : "-inf";
    return;
  }
  char buf[64];
  auto res = std::to_chars(buf, buf + sizeof buf, d);
  out.append(buf, res.ptr);
}

void appendDate(std::string& out, const Date& d) {
  double secs = std::floor(d.secondsSince1970);
  if (!(secs > -62135596800.0 && secs < 253402300800.0)) {  // years 1..9999
    out += "date(";
    appendReal(out, d.secondsSince1970);
    out += ")";
    return;
  }
  time_t t = static_cast<time_t>(secs);
  struct tm tm;
  gmtime_r(&t, &tm);
  char buf[40];
  std::strftime(buf, sizeof buf, "%Y-%m-%dT%H:%M:%SZ", &tm);
  out += buf;
}

void appendDescription(std::string& out, const Value& v, bool nested, int depth) {
  constexpr int kMaxDepth = 64;
  if (depth > kMaxDepth) {
    out += "...";
    return;
  }
  switch (v.type()) {
    case Value::Type::kNull:
      out += nested ? "<null>" : "(null)";
      break;
    case Value::Type::kBoolean:
      out += *v.getIfBoolean() ? "true" : "false";
      break;
    case Value::Type::kInteger:
      out += v.isUnsignedInteger() ? std::to_string(v.unsignedValue())
                                   : std::to_string(v.integerValue());
      break;
    case Value::Type::kReal:
      appendReal(out, *v.getIfReal());
      break;
    case Value::Type::kString:
      if (nested) {
        appendQuoted(out, *v.getIfString());
      } else {
        out += *v.getIfString();
      }
      break;
    case Value::Type::kData: {
      const auto& bytes = *v.getIfData();
      out += '<';
      constexpr size_t kShown = 64;
      char buf[4];
      for (size_t i = 0; i < bytes.size() && i < kShown; ++i) {
        std::snprintf(buf, sizeof buf, "%02x", bytes[i]);
        out += buf;
      }
      if (bytes.size() > kShown) out += "...";
      out += '>';
      break;
    }
    case Value::Type::kDate:
      appendDate(out, *v.getIfDate());
      break;
    case Value::Type::kUuid:
      out += v.getIfUuid()->string();
      break;
    case Value::Type::kArray: {
      out += '(';
      bool first = true;
      for (const Value& e : *v.getIfArray()) {
        if (!first) out += ", ";
        first = false;
        appendDescription(out, e, true, depth + 1);
      }
      out += ')';
      break;
    }
    case Value::Type::kDictionary: {
      out += '{';
      bool first = true;
      for (const auto& [k, e] : *v.getIfDictionary()) {
        if (!first) out += "; ";
        first = false;
        appendQuoted(out, k);
        out += " = ";
        appendDescription(out, e, true, depth + 1);
      }
      out += '}';
      break;
    }
  }
}

}  // namespace

std::string describe(const Value& v) {
  std::string out;
  appendDescription(out, v, false, 0);
  return out;
}

std::string describe(const Array& a) {
  return describe(Value(a));
}

std::string describe(const Dictionary& d) {
  return describe(Value(d));
}

const char* typeName(Value::Type t) {
  switch (t) {
    case Value::Type::kNull:
      return "null";
    case Value::Type::kBoolean:
      return "boolean";
    case Value::Type::kInteger:
      return "integer";
    case Value::Type::kReal:
      return "real";
    case Value::Type::kString:
      return "string";
    case Value::Type::kData:
      return "data";
    case Value::Type::kDate:
      return "date";
    case Value::Type::kUuid:
      return "uuid";
    case Value::Type::kArray:
      return "array";
    case Value::Type::kDictionary:
      return "dictionary";
  }
  return "unknown";
}

}  // namespace vantrel::lmo
