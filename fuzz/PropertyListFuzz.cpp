// The property-list reader: the checks in front of libplist, and libplist
// behind them. Anyone can write the files it reads (Info.plist,
// Entitlements.plist, SDK dictionaries, types.plist), so it is fuzzed
// differentially:
//  - XML the checks accept must read, and read as the document says: this
//    target reads the checks' cleaned document with a reader of its own
//    (the grammar is small once the checks have cleaned it) and compares.
//  - Whatever reads (XML or binary) must write as XML and read back as the
//    same value (but for the documented limits of libplist), its XML as
//    libplist writes it in binary must pass the binary checks and read as
//    the same value, and it must cross the wire: CBOR-encode and decode to
//    the same value.
// libplist misbehaving on anything the checks let through (a crash, a read
// past a buffer) is found by the sanitizers.

#include <plist/plist.h>

#include <charconv>
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <limits>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "fuzz/FuzzSupport.h"
#include "lmo/Cbor.h"
#include "lmo/LmoError.h"
#include "platform/PropertyList.h"
#include "platform/PropertyListChecks.h"

namespace {

using namespace vantrel;
using lmo::Value;

// ---------------------------------------------------------------------------
// A reader of the cleaned XML the checks return: <plist>, containers, and
// leaves whose text is as the input had it (entities and CDATA in strings
// and keys; trimmed numbers and dates; base64 with its blanks).

class CleanReader {
 public:
  explicit CleanReader(std::string_view xml) : in_(xml) {}

  std::optional<Value> document() {
    if (!take("<plist>")) return std::nullopt;
    std::optional<Value> v = value();
    if (!v || !take("</plist>") || pos_ != in_.size()) return std::nullopt;
    return v;
  }

 private:
  bool take(std::string_view s) {
    if (in_.substr(pos_, s.size()) != s) return false;
    pos_ += s.size();
    return true;
  }

  std::optional<Value> value() {
    if (take("<true/>")) return Value::boolean(true);
    if (take("<false/>")) return Value::boolean(false);
    if (take("<array/>")) return Value(lmo::Array());
    if (take("<dict/>")) return Value(lmo::Dictionary());
    if (take("<array>")) {
      std::vector<Value> items;
      while (!take("</array>")) {
        std::optional<Value> item = value();
        if (!item) return std::nullopt;
        items.push_back(std::move(*item));
      }
      return Value(lmo::Array(std::move(items)));
    }
    if (take("<dict>")) {
      std::vector<lmo::Dictionary::Entry> entries;
      while (!take("</dict>")) {
        std::optional<std::string> key = leaf("key");
        std::optional<Value> item = key ? value() : std::nullopt;
        if (!item) return std::nullopt;
        entries.emplace_back(std::move(*key), std::move(*item));
      }
      // A key given twice: the later value stands, in both readers.
      return Value(lmo::Dictionary::fromEntries(std::move(entries)));
    }
    for (const char* name : {"string", "integer", "real", "date", "data"}) {
      std::optional<std::string> text = leaf(name);
      if (!text) continue;
      const std::string_view kind = name;
      if (kind == "string") return Value(std::move(*text));
      if (kind == "integer") return integer(*text);
      if (kind == "real") return real(*text);
      if (kind == "date") return date(*text);
      return data(*text);
    }
    return std::nullopt;
  }

  // The text of <name>...</name>, entities and CDATA decoded.
  std::optional<std::string> leaf(std::string_view name) {
    const std::string open = "<" + std::string(name) + ">";
    const std::string close = "</" + std::string(name) + ">";
    if (!take(open)) return std::nullopt;
    std::string text;
    while (pos_ < in_.size()) {
      if (take(close)) return text;
      if (take("<![CDATA[")) {
        const size_t end = in_.find("]]>", pos_);
        if (end == std::string_view::npos) return std::nullopt;
        text.append(in_.substr(pos_, end - pos_));
        pos_ = end + 3;
      } else if (in_[pos_] == '&') {
        if (!entity(text)) return std::nullopt;
      } else {
        text.push_back(in_[pos_++]);
      }
    }
    return std::nullopt;
  }

  bool entity(std::string& out) {
    const size_t semicolon = in_.find(';', pos_);
    if (semicolon == std::string_view::npos) return false;
    const std::string_view name = in_.substr(pos_ + 1, semicolon - pos_ - 1);
    pos_ = semicolon + 1;
    static constexpr std::pair<std::string_view, char> kNamed[] = {
        {"amp", '&'}, {"lt", '<'}, {"gt", '>'}, {"quot", '"'}, {"apos", '\''}};
    for (const auto& [entityName, c] : kNamed) {
      if (name == entityName) {
        out.push_back(c);
        return true;
      }
    }
    if (name.size() < 2 || name[0] != '#') return false;
    const bool hex = name[1] == 'x' || name[1] == 'X';
    const std::string_view digits = name.substr(hex ? 2 : 1);
    uint32_t code = 0;
    auto [end, ec] = std::from_chars(digits.data(), digits.data() + digits.size(), code,
                                     hex ? 16 : 10);
    if (ec != std::errc() || end != digits.data() + digits.size()) return false;
    appendUtf8(out, code);
    return true;
  }

  static void appendUtf8(std::string& out, uint32_t c) {
    if (c < 0x80) {
      out.push_back(static_cast<char>(c));
    } else if (c < 0x800) {
      out.push_back(static_cast<char>(0xC0 | c >> 6));
      out.push_back(static_cast<char>(0x80 | (c & 0x3F)));
    } else if (c < 0x10000) {
      out.push_back(static_cast<char>(0xE0 | c >> 12));
      out.push_back(static_cast<char>(0x80 | ((c >> 6) & 0x3F)));
      out.push_back(static_cast<char>(0x80 | (c & 0x3F)));
    } else {
      out.push_back(static_cast<char>(0xF0 | c >> 18));
      out.push_back(static_cast<char>(0x80 | ((c >> 12) & 0x3F)));
      out.push_back(static_cast<char>(0x80 | ((c >> 6) & 0x3F)));
      out.push_back(static_cast<char>(0x80 | (c & 0x3F)));
    }
  }

  // [+|-][0x]digits; a negative value is signed, a positive one signed
  // unless only an unsigned 64-bit integer holds it.
  static std::optional<Value> integer(std::string_view t) {
    bool negative = false;
    if (!t.empty() && (t[0] == '-' || t[0] == '+')) {
      negative = t[0] == '-';
      t.remove_prefix(1);
    }
    int base = 10;
    if (t.size() > 2 && t[0] == '0' && (t[1] == 'x' || t[1] == 'X')) {
      base = 16;
      t.remove_prefix(2);
    }
    uint64_t magnitude = 0;
    auto [end, ec] = std::from_chars(t.data(), t.data() + t.size(), magnitude, base);
    if (ec != std::errc() || end != t.data() + t.size()) return std::nullopt;
    if (negative) return Value::integer(static_cast<int64_t>(0 - magnitude));
    if (magnitude > static_cast<uint64_t>(std::numeric_limits<int64_t>::max())) {
      return Value::unsignedInteger(magnitude);
    }
    return Value::integer(static_cast<int64_t>(magnitude));
  }

  static std::optional<Value> real(std::string_view t) {
    if (!t.empty() && t[0] == '+') t.remove_prefix(1);
    double d = 0;
    auto [end, ec] = std::from_chars(t.data(), t.data() + t.size(), d);
    if (ec != std::errc() || end != t.data() + t.size()) return std::nullopt;
    return Value::real(d);
  }

  // YYYY-MM-DDTHH:MM:SSZ. A day past the month's end runs into the next
  // month (libplist's reading, and mktime's), counted here by day number.
  static std::optional<Value> date(std::string_view t) {
    auto number = [&](size_t at, size_t n) {
      int v = 0;
      std::from_chars(t.data() + at, t.data() + at + n, v);
      return v;
    };
    if (t.size() != 20) return std::nullopt;
    const int64_t y = number(0, 4), m = number(5, 2), d = number(8, 2);
    // Days from 1970-01-01 to the first of the month (the civil-from-days
    // inverse: years begin in March so that leap days come last).
    const int64_t ya = m <= 2 ? y - 1 : y;
    const int64_t era = (ya >= 0 ? ya : ya - 399) / 400;
    const int64_t yoe = ya - era * 400;
    const int64_t doy = (153 * (m + (m > 2 ? -3 : 9)) + 2) / 5;
    const int64_t doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
    const int64_t days = era * 146097 + doe - 719468 + (d - 1);
    const int64_t seconds = days * 86400 + number(11, 2) * 3600 + number(14, 2) * 60 + number(17, 2);
    return Value(lmo::Date{static_cast<double>(seconds)});
  }

  static std::optional<Value> data(std::string_view t) {
    std::vector<uint8_t> bytes;
    uint32_t bits = 0;
    int count = 0;
    for (char c : t) {
      int v;
      if (c >= 'A' && c <= 'Z') {
        v = c - 'A';
      } else if (c >= 'a' && c <= 'z') {
        v = c - 'a' + 26;
      } else if (c >= '0' && c <= '9') {
        v = c - '0' + 52;
      } else if (c == '+' || c == '/') {
        v = c == '+' ? 62 : 63;
      } else {
        continue;  // blanks and padding
      }
      bits = bits << 6 | static_cast<uint32_t>(v);
      if (++count % 4 == 0) {
        bytes.push_back(static_cast<uint8_t>(bits >> 16));
        bytes.push_back(static_cast<uint8_t>(bits >> 8));
        bytes.push_back(static_cast<uint8_t>(bits));
        bits = 0;
      }
    }
    if (count % 4 == 2) bytes.push_back(static_cast<uint8_t>(bits >> 4));
    if (count % 4 == 3) {
      bytes.push_back(static_cast<uint8_t>(bits >> 10));
      bytes.push_back(static_cast<uint8_t>(bits >> 2));
    }
    return Value::data(std::move(bytes));
  }

  std::string_view in_;
  size_t pos_ = 0;
};

// ---------------------------------------------------------------------------
// Round trips.

// v as it reads back from the XML libplist writes of it: an unsigned integer
// above INT64_MAX comes back as the signed integer of the same bits, a real
// -0 as 0, and a date loses its fraction (the documented limits).
Value asWrittenInXml(const Value& v) {
  switch (v.type()) {
    case Value::Type::kInteger:
      return v.isUnsignedInteger() ? Value::integer(static_cast<int64_t>(*v.getIfUInt64())) : v;
    case Value::Type::kReal:
      return *v.getIfReal() == 0 ? Value::real(0) : v;
    case Value::Type::kDate:
      return Value(lmo::Date{std::floor(v.getIfDate()->secondsSince1970)});
    case Value::Type::kArray: {
      std::vector<Value> items;
      for (const Value& item : *v.getIfArray()) items.push_back(asWrittenInXml(item));
      return Value(lmo::Array(std::move(items)));
    }
    case Value::Type::kDictionary: {
      std::vector<lmo::Dictionary::Entry> entries;
      for (const auto& [key, item] : *v.getIfDictionary()) {
        entries.emplace_back(key, asWrittenInXml(item));
      }
      return Value(lmo::Dictionary::fromEntries(std::move(entries)));
    }
    default:
      return v;
  }
}

struct PlistFree {
  void operator()(void* node) const { plist_free(node); }
};

// libplist's binary form of an XML property list it reads; empty when it
// reads none.
std::string binaryOf(const std::string& xml) {
  plist_t root = nullptr;
  plist_from_xml(xml.data(), static_cast<uint32_t>(xml.size()), &root);
  if (root == nullptr) return {};
  std::unique_ptr<void, PlistFree> owner(root);
  char* bin = nullptr;
  uint32_t length = 0;
  plist_to_bin(root, &bin, &length);
  std::string bytes = bin != nullptr ? std::string(bin, length) : std::string();
  std::free(bin);
  return bytes;
}

void checkRoundTrips(const Value& read) {
  auto cbor = lmo::encodeCbor(read);
  if (cbor.has_value()) {
    auto fromWire = lmo::decodeCbor(cbor.value().data(), cbor.value().size());
    FUZZ_REQUIRE(fromWire.has_value() && fuzz::sameValue(fromWire.value(), read),
                 "a property list crosses the wire unchanged",
                 fromWire.has_value() ? describe(read) : fromWire.error().description());
  } else {
    // Property lists may nest deeper than the wire carries.
    FUZZ_REQUIRE(cbor.error().code == lmo::kLmoLimitExceeded,
                 "a property list encodes as CBOR unless it is too deep",
                 cbor.error().description());
  }

  auto xml = platform::writePropertyListXML(read);
  if (!xml.has_value()) {
    // A date or a string with no XML form: documented, and refused cleanly.
    FUZZ_REQUIRE(xml.error().code == platform::kPropertyListUnrepresentable,
                 "what was read can be written", xml.error().description());
    return;
  }
  auto again = platform::readPropertyList(xml.value());
  FUZZ_REQUIRE(again.has_value(), "written XML reads", again.error().description());
  FUZZ_REQUIRE(fuzz::sameValue(again.value(), asWrittenInXml(read)),
               "written XML reads as the value written",
               describe(read) + "\n" + describe(again.value()));

  const std::string binary = binaryOf(xml.value());
  FUZZ_REQUIRE(!binary.empty(), "libplist reads the XML it wrote", xml.value());
  auto fromBinary = platform::readPropertyList(binary);
  FUZZ_REQUIRE(fromBinary.has_value(), "the binary checks accept libplist's binary form",
               fromBinary.error().description());
  FUZZ_REQUIRE(fuzz::sameValue(fromBinary.value(), again.value()),
               "a property list reads the same from binary as from XML",
               describe(again.value()) + "\n" + describe(fromBinary.value()));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view input(reinterpret_cast<const char*>(data), size);
  const base::Result<Value> read = platform::readPropertyList(input);
  if (!input.starts_with("bplist00") && size <= platform::kMaxPropertyListBytes) {
    const base::Result<std::string> clean = platform::plist_checks::preflightXml(input);
    if (clean.has_value()) {
      FUZZ_REQUIRE(read.has_value(), "XML the checks accept reads", read.error().description());
      std::optional<Value> expected = CleanReader(clean.value()).document();
      FUZZ_REQUIRE(expected.has_value(), "the checks return XML of the property-list grammar",
                   clean.value());
      FUZZ_REQUIRE(fuzz::sameValue(read.value(), *expected),
                   "libplist reads what the document says",
                   describe(*expected) + "\n" + describe(read.value()));
    }
  }
  if (read.has_value()) checkRoundTrips(read.value());
  return 0;
}
