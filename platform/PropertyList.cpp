#include "platform/PropertyList.h"

#include <fcntl.h>
#include <plist/plist.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <vector>

#include "platform/AtomicFile.h"

namespace vantrel::platform {
namespace {

using lmo::Value;

// libplist keeps dates as seconds since 2001-01-01 00:00:00 UTC.
constexpr double kSecondsFrom1970To2001 = 978307200.0;

base::Error plistError(int64_t code, std::string message) {
  return base::Error{kPropertyListErrorDomain, code, std::move(message)};
}

base::Error malformed(const char* what) {
  return plistError(kPropertyListMalformed, base::format("not a valid property list: %s", what));
}

base::Error tooDeep() {
  return plistError(
      kPropertyListTooLarge,
      base::format("property list nested deeper than %d levels", kMaxPropertyListDepth));
}

base::Error tooManyObjects() {
  return plistError(kPropertyListTooLarge, base::format("property list holds more than %u values",
                                                        kMaxPropertyListObjects));
}

struct PlistFree {
  void operator()(plist_t node) const { plist_free(node); }
};
using PlistPtr = std::unique_ptr<void, PlistFree>;

bool isXmlSpace(char c) {
  return c == ' ' || c == '\t' || c == '\r' || c == '\n';
}

std::string_view trimmed(std::string_view s) {
  while (!s.empty() && isXmlSpace(s.front())) s.remove_prefix(1);
  while (!s.empty() && isXmlSpace(s.back())) s.remove_suffix(1);
  return s;
}

bool allOf(std::string_view s, bool (*pred)(char)) {
  for (char c : s) {
    if (!pred(c)) return false;
  }
  return true;
}

bool isDigit(char c) {
  return c >= '0' && c <= '9';
}
bool isHexDigit(char c) {
  return isDigit(c) || (c >= 'a' && c <= 'f') || (c >= 'A' && c <= 'F');
}

// ---------------------------------------------------------------------------
// XML preflight. libplist 2.2's XML parser recurses once per nesting level
// (a few hundred thousand levels exhaust the stack) and quietly accepts bad
// values ("12abc" reads as 12, an unreadable date as 1970, a second root is
// dropped). So XML is first checked here against the property-list grammar,
// with the nesting bounded, and rewritten without comments, processing
// instructions or the document type. libplist then parses only markup this
// check has understood, and cannot disagree with it about the structure.

bool validEntities(std::string_view text);

class XmlPreflight {
 public:
  explicit XmlPreflight(std::string_view input) : in_(input) {}

  // The cleaned document, or why it is not a property list.
  base::Result<std::string> run();

 private:
  enum class Container { kPlist, kArray, kDict };
  struct Open {
    Container kind;
    bool filled = false;  // plist: has its value; dict: a key waits for its value
  };
  struct Tag {
    std::string_view name;
    bool closing = false;
    bool empty = false;  // <name/>
  };

  bool startsWith(std::string_view s) const { return in_.substr(pos_, s.size()) == s; }
  void skipSpace() {
    while (pos_ < in_.size() && isXmlSpace(in_[pos_])) ++pos_;
  }
  // Moves past the next occurrence of terminator; false when there is none.
  bool skipPast(std::string_view terminator);
  std::optional<base::Error> skipDoctype();
  std::optional<base::Error> readTag(Tag* tag);
  std::optional<base::Error> readAttributes();
  std::optional<base::Error> openTag(const Tag& tag);
  std::optional<base::Error> closeTag(const Tag& tag);
  std::optional<base::Error> leaf(const Tag& tag);
  std::optional<base::Error> leafText(std::string_view name, std::string* text);
  std::optional<base::Error> valueAllowedHere(std::string_view name) const;
  void valueDone();

  std::string_view in_;
  size_t pos_ = 0;
  std::string out_;
  std::vector<Open> stack_;
  int containers_ = 0;  // arrays and dicts on stack_
  bool rootDone_ = false;
};

bool XmlPreflight::skipPast(std::string_view terminator) {
  const size_t at = in_.find(terminator, pos_);
  if (at == std::string_view::npos) return false;
  pos_ = at + terminator.size();
  return true;
}

std::optional<base::Error> XmlPreflight::skipDoctype() {
  if (rootDone_ || !stack_.empty()) return malformed("document type inside the document");
  // The internal subset may hold '>' inside brackets or quotes.
  int brackets = 0;
  char quote = 0;
  for (; pos_ < in_.size(); ++pos_) {
    const char c = in_[pos_];
    if (quote != 0) {
      if (c == quote) quote = 0;
    } else if (c == '"' || c == '\'') {
      quote = c;
    } else if (c == '[') {
      ++brackets;
    } else if (c == ']') {
      --brackets;
    } else if (c == '>' && brackets <= 0) {
      ++pos_;
      return std::nullopt;
    }
  }
  return malformed("unterminated document type");
}

std::optional<base::Error> XmlPreflight::readTag(Tag* tag) {
  ++pos_;  // '<'
  if (pos_ < in_.size() && in_[pos_] == '/') {
    tag->closing = true;
    ++pos_;
  }
  const size_t start = pos_;
  while (pos_ < in_.size() && in_[pos_] >= 'a' && in_[pos_] <= 'z') ++pos_;
  tag->name = in_.substr(start, pos_ - start);
  if (tag->name.empty()) return malformed("bad tag");
  if (!tag->closing && tag->name == "plist") {
    if (auto error = readAttributes()) return error;
  }
  skipSpace();
  if (!tag->closing && startsWith("/")) {
    tag->empty = true;
    ++pos_;
  }
  if (!startsWith(">")) return malformed("bad tag");
  ++pos_;
  return std::nullopt;
}

// Attributes of <plist> (its version) are read and dropped. Their values may
// not hold '<' or '>', so no reading of the tag can end it elsewhere.
std::optional<base::Error> XmlPreflight::readAttributes() {
  while (true) {
    const size_t before = pos_;
    skipSpace();
    if (pos_ == before || pos_ >= in_.size() || !(in_[pos_] >= 'a' && in_[pos_] <= 'z')) {
      return std::nullopt;
    }
    while (pos_ < in_.size() && in_[pos_] >= 'a' && in_[pos_] <= 'z') ++pos_;
    skipSpace();
    if (!startsWith("=")) return malformed("bad attribute");
    ++pos_;
    skipSpace();
    if (pos_ >= in_.size() || (in_[pos_] != '"' && in_[pos_] != '\'')) {
      return malformed("bad attribute");
    }
    const char quote = in_[pos_++];
    const size_t end = in_.find(quote, pos_);
    if (end == std::string_view::npos) return malformed("bad attribute");
    const std::string_view value = in_.substr(pos_, end - pos_);
    if (value.find_first_of("<>") != std::string_view::npos) return malformed("bad attribute");
    pos_ = end + 1;
  }
}

std::optional<base::Error> XmlPreflight::valueAllowedHere(std::string_view name) const {
  if (stack_.empty()) {
    if (rootDone_) return malformed("more than one root value");
    return std::nullopt;
  }
  const Open& top = stack_.back();
  switch (top.kind) {
    case Container::kPlist:
      if (top.filled) return malformed("more than one root value");
      break;
    case Container::kArray:
      break;
    case Container::kDict:
      if (!top.filled && name != "key") return malformed("dictionary value without a key");
      if (top.filled && name == "key") return malformed("dictionary key without a value");
      return std::nullopt;
  }
  if (name == "key") return malformed("key outside a dictionary");
  return std::nullopt;
}

void XmlPreflight::valueDone() {
  if (stack_.empty()) {
    rootDone_ = true;
    return;
  }
  Open& top = stack_.back();
  top.filled = top.kind == Container::kDict ? !top.filled : true;
}

std::optional<base::Error> XmlPreflight::openTag(const Tag& tag) {
  if (tag.name == "plist") {
    if (!stack_.empty() || rootDone_) return malformed("misplaced <plist>");
    if (tag.empty) return malformed("empty <plist>");
    stack_.push_back({Container::kPlist});
    out_ += "<plist>";
    return std::nullopt;
  }
  if (auto error = valueAllowedHere(tag.name)) return error;
  if (tag.name == "array" || tag.name == "dict") {
    out_ += '<';
    out_ += tag.name;
    if (tag.empty) {
      out_ += "/>";
      valueDone();
      return std::nullopt;
    }
    out_ += '>';
    if (++containers_ > kMaxPropertyListDepth) return tooDeep();
    stack_.push_back({tag.name == "array" ? Container::kArray : Container::kDict});
    return std::nullopt;
  }
  if (tag.name == "true" || tag.name == "false") {
    if (!tag.empty) {
      skipSpace();
      Tag close;
      if (!startsWith("</") || readTag(&close) || close.name != tag.name) {
        return malformed("bad boolean");
      }
    }
    out_ += '<';
    out_ += tag.name;
    out_ += "/>";
    valueDone();
    return std::nullopt;
  }
  return leaf(tag);
}

std::optional<base::Error> XmlPreflight::closeTag(const Tag& tag) {
  if (stack_.empty()) return malformed("unbalanced closing tag");
  const Open top = stack_.back();
  const std::string_view expected = top.kind == Container::kPlist   ? "plist"
                                    : top.kind == Container::kArray ? "array"
                                                                    : "dict";
  if (tag.name != expected) return malformed("mismatched closing tag");
  if (top.kind == Container::kPlist && !top.filled) return malformed("empty <plist>");
  if (top.kind == Container::kDict && top.filled)
    return malformed("dictionary key without a value");
  stack_.pop_back();
  if (top.kind != Container::kPlist) --containers_;
  out_ += "</";
  out_ += expected;
  out_ += '>';
  if (top.kind == Container::kPlist) {
    rootDone_ = true;
  } else {
    valueDone();
  }
  return std::nullopt;
}

// Text of a leaf element up to its closing tag, comments dropped; CDATA is
// kept (as CDATA) in strings and keys only.
std::optional<base::Error> XmlPreflight::leafText(std::string_view name, std::string* text) {
  const bool textual = name == "string" || name == "key";
  while (pos_ < in_.size()) {
    const size_t lt = in_.find('<', pos_);
    if (lt == std::string_view::npos) break;
    const std::string_view chars = in_.substr(pos_, lt - pos_);
    if (textual && !validEntities(chars)) return malformed("bad entity");
    text->append(chars);
    pos_ = lt;
    if (startsWith("<!--")) {
      if (!skipPast("-->")) return malformed("unterminated comment");
    } else if (startsWith("<![CDATA[") && textual) {
      const size_t start = pos_;
      if (!skipPast("]]>")) return malformed("unterminated CDATA section");
      text->append(in_.substr(start, pos_ - start));
    } else if (startsWith("</")) {
      Tag close;
      if (auto error = readTag(&close)) return error;
      if (close.name != name) return malformed("mismatched closing tag");
      return std::nullopt;
    } else {
      return malformed("markup inside a value");
    }
  }
  return malformed("unterminated value");
}

// Entities in character data: the five predefined ones and character
// references to anything but NUL.
bool validEntities(std::string_view text) {
  for (size_t at = text.find('&'); at != std::string_view::npos; at = text.find('&', at + 1)) {
    const size_t semicolon = text.find(';', at);
    if (semicolon == std::string_view::npos) return false;
    const std::string_view entity = text.substr(at + 1, semicolon - at - 1);
    if (entity == "amp" || entity == "lt" || entity == "gt" || entity == "quot" ||
        entity == "apos") {
      continue;
    }
    if (entity.size() < 2 || entity.size() > 8 || entity[0] != '#') return false;
    const bool hex = entity[1] == 'x' || entity[1] == 'X';
    const std::string_view digits = entity.substr(hex ? 2 : 1);
    if (digits.empty() || !allOf(digits, hex ? isHexDigit : isDigit)) return false;
    unsigned long code = 0;
    std::from_chars(digits.data(), digits.data() + digits.size(), code, hex ? 16 : 10);
    if (code == 0 || code > 0x10FFFF) return false;
  }
  return true;
}

bool validInteger(std::string_view text) {
  bool negative = false;
  if (!text.empty() && (text[0] == '-' || text[0] == '+')) {
    negative = text[0] == '-';
    text.remove_prefix(1);
  }
  int base = 10;
  if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
    base = 16;
    text.remove_prefix(2);
  }
  if (text.empty() || !allOf(text, base == 16 ? isHexDigit : isDigit)) return false;
  uint64_t magnitude = 0;
  const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), magnitude, base);
  if (ec != std::errc() || end != text.data() + text.size()) return false;  // above UINT64_MAX
  return !negative || magnitude <= uint64_t{1} << 63;
}

// Decimal notation, or inf, infinity and nan in any case, with a sign.
bool validReal(std::string_view text) {
  if (!text.empty() && text[0] == '+') {
    text.remove_prefix(1);
    if (!text.empty() && text[0] == '-') return false;
  }
  double value = 0;
  const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
  return ec == std::errc() && end == text.data() + text.size();
}

// YYYY-MM-DDTHH:MM:SSZ, the only form property lists write.
bool validDate(std::string_view text) {
  static constexpr std::string_view kShape = "dddd-dd-ddTdd:dd:ddZ";
  if (text.size() != kShape.size()) return false;
  for (size_t i = 0; i < text.size(); ++i) {
    if (kShape[i] == 'd' ? !isDigit(text[i]) : text[i] != kShape[i]) return false;
  }
  auto number = [&](size_t at, size_t n) {
    int v = 0;
    std::from_chars(text.data() + at, text.data() + at + n, v);
    return v;
  };
  return number(5, 2) >= 1 && number(5, 2) <= 12 && number(8, 2) >= 1 && number(8, 2) <= 31 &&
         number(11, 2) <= 23 && number(14, 2) <= 59 && number(17, 2) <= 60;
}

bool validBase64(std::string_view text) {
  size_t count = 0, padding = 0;
  for (char c : text) {
    if (isXmlSpace(c)) continue;
    const bool alphabet =
        (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || isDigit(c) || c == '+' || c == '/';
    if (c == '=') {
      ++padding;
    } else if (!alphabet || padding > 0) {
      return false;
    }
    ++count;
  }
  return count % 4 == 0 && padding <= 2;
}

std::optional<base::Error> XmlPreflight::leaf(const Tag& tag) {
  const std::string_view name = tag.name;
  if (name != "key" && name != "string" && name != "integer" && name != "real" && name != "date" &&
      name != "data") {
    return malformed("unknown element");
  }
  std::string text;
  if (!tag.empty) {
    if (auto error = leafText(name, &text)) return error;
  }
  // Strings and keys had their entities checked as the text was read.
  bool ok = true;
  if (name == "data") {
    ok = validBase64(text);
  } else if (name != "key" && name != "string") {
    const std::string_view value = trimmed(text);
    ok = name == "integer" ? validInteger(value)
         : name == "real"  ? validReal(value)
                           : validDate(value);
    text = std::string(value);
  }
  if (!ok) return malformed("bad value");
  out_ += '<';
  out_ += name;
  out_ += '>';
  out_ += text;
  out_ += "</";
  out_ += name;
  out_ += '>';
  valueDone();
  return std::nullopt;
}

base::Result<std::string> XmlPreflight::run() {
  if (in_.find('\0') != std::string_view::npos) return malformed("NUL byte");
  if (startsWith("\xEF\xBB\xBF")) pos_ = 3;  // UTF-8 byte order mark
  while (true) {
    skipSpace();
    if (pos_ >= in_.size()) break;
    if (in_[pos_] != '<') return malformed("text outside an element");
    if (startsWith("<?")) {
      if (!skipPast("?>")) return malformed("unterminated processing instruction");
    } else if (startsWith("<!--")) {
      if (!skipPast("-->")) return malformed("unterminated comment");
    } else if (startsWith("<!DOCTYPE")) {
      if (auto error = skipDoctype()) return *error;
    } else if (startsWith("<!")) {
      return malformed("unexpected declaration");
    } else {
      Tag tag;
      if (auto error = readTag(&tag)) return *error;
      if (auto error = tag.closing ? closeTag(tag) : openTag(tag)) return *error;
    }
  }
  if (!stack_.empty()) return malformed("unterminated element");
  if (!rootDone_) return malformed("no value");
  return std::move(out_);
}

// ---------------------------------------------------------------------------
// Binary preflight. libplist 2.2's binary parser expands shared objects (a
// hundred bytes of references can ask for gigabytes), takes time quadratic in
// the nesting depth and recurses per level. So the object graph is walked
// here first, without recursion, with the depth and the expanded object count
// bounded, before libplist sees the bytes.

class BinaryPreflight {
 public:
  explicit BinaryPreflight(std::string_view input) : in_(input) {}
  std::optional<base::Error> run();

 private:
  struct Frame {
    size_t refs;        // offset of the next reference
    uint64_t left;      // references still to visit
    uint64_t keysLeft;  // of those, how many are dictionary keys
  };

  uint64_t readInt(size_t at, size_t size) const {
    uint64_t v = 0;
    for (size_t i = 0; i < size; ++i) v = v << 8 | static_cast<uint8_t>(in_[at + i]);
    return v;
  }
  std::optional<base::Error> visit(uint64_t ref, bool mustBeKey, std::vector<Frame>* stack);
  std::optional<base::Error> checkScalar(size_t offset) const;
  // The object count of a container (or length of a scalar) at offset, and
  // where its payload starts; false when it runs past the object area.
  bool countAt(size_t offset, uint64_t* count, size_t* payload) const;

  std::string_view in_;
  size_t offsetSize_ = 0, refSize_ = 0, tableOffset_ = 0;
  uint64_t objectCount_ = 0;
  size_t visited_ = 0;
};

bool BinaryPreflight::countAt(size_t offset, uint64_t* count, size_t* payload) const {
  const uint8_t marker = static_cast<uint8_t>(in_[offset]);
  *payload = offset + 1;
  if ((marker & 0xF) != 0xF) {
    *count = marker & 0xF;
    return true;
  }
  if (*payload >= tableOffset_) return false;
  const uint8_t intMarker = static_cast<uint8_t>(in_[*payload]);
  if ((intMarker & 0xF0) != 0x10 || (intMarker & 0xF) > 3) return false;
  const size_t size = size_t{1} << (intMarker & 0xF);
  if (*payload + 1 + size > tableOffset_) return false;
  *count = readInt(*payload + 1, size);
  *payload += 1 + size;
  return true;
}

std::optional<base::Error> BinaryPreflight::visit(uint64_t ref, bool mustBeKey,
                                                  std::vector<Frame>* stack) {
  if (ref >= objectCount_) return malformed("bad object reference");
  if (++visited_ > kMaxPropertyListObjects) return tooManyObjects();
  const uint64_t offset = readInt(tableOffset_ + ref * offsetSize_, offsetSize_);
  if (offset < 8 || offset >= tableOffset_) return malformed("bad object offset");
  const uint8_t marker = static_cast<uint8_t>(in_[offset]);
  const uint8_t type = marker >> 4;
  if (mustBeKey && type != 0x5 && type != 0x6) return malformed("dictionary key not a string");
  if (type != 0xA && type != 0xC && type != 0xD) return checkScalar(offset);
  uint64_t count = 0;
  size_t payload = 0;
  if (!countAt(offset, &count, &payload)) return malformed("truncated container");
  const uint64_t refs = type == 0xD ? 2 * count : count;
  // A container may repeat a reference, so its count is bounded by the bytes
  // its references take, not by the number of objects.
  if (count > tableOffset_ || payload + refs * refSize_ > tableOffset_) {
    return malformed("truncated container");
  }
  if (stack->size() >= static_cast<size_t>(kMaxPropertyListDepth)) return tooDeep();
  stack->push_back({payload, refs, type == 0xD ? count : 0});
  return std::nullopt;
}

// The scalars libplist 2.2 mishandles rather than refuses: it aborts on a
// UTF-16 string holding U+0000, cuts an ASCII string at a NUL, reads a UTF-16
// string with an unpaired surrogate as empty and keeps only the low 64 bits of
// wider integers and UIDs.
std::optional<base::Error> BinaryPreflight::checkScalar(size_t offset) const {
  const uint8_t marker = static_cast<uint8_t>(in_[offset]);
  const uint8_t type = marker >> 4;
  if (marker == 0x14) {
    if (offset + 17 > tableOffset_) return malformed("truncated integer");
    if (readInt(offset + 1, 8) != 0) return malformed("integer out of range");
  } else if (type == 0x8 && (marker & 0xF) >= 8) {
    return malformed("UID out of range");
  } else if (type == 0x5 || type == 0x6) {
    uint64_t count = 0;
    size_t payload = 0;
    const size_t unit = type == 0x5 ? 1 : 2;
    if (!countAt(offset, &count, &payload) || count > tableOffset_ ||
        payload + count * unit > tableOffset_) {
      return malformed("truncated string");
    }
    bool highSurrogate = false;
    for (uint64_t i = 0; i < count; ++i) {
      const uint64_t c = readInt(payload + i * unit, unit);
      if (c == 0) return malformed("NUL character in a string");
      if (unit == 1) continue;
      const bool high = c >= 0xD800 && c <= 0xDBFF, low = c >= 0xDC00 && c <= 0xDFFF;
      if (highSurrogate != low) return malformed("unpaired surrogate in a string");
      highSurrogate = high;
    }
    if (highSurrogate) return malformed("unpaired surrogate in a string");
  }
  return std::nullopt;
}

std::optional<base::Error> BinaryPreflight::run() {
  constexpr size_t kHeader = 8, kTrailer = 32;
  if (in_.size() < kHeader + kTrailer) return malformed("truncated binary property list");
  const size_t trailer = in_.size() - kTrailer;
  offsetSize_ = static_cast<uint8_t>(in_[trailer + 6]);
  refSize_ = static_cast<uint8_t>(in_[trailer + 7]);
  objectCount_ = readInt(trailer + 8, 8);
  const uint64_t top = readInt(trailer + 16, 8);
  const uint64_t tableOffset = readInt(trailer + 24, 8);
  if (offsetSize_ < 1 || offsetSize_ > 8 || refSize_ < 1 || refSize_ > 8 || objectCount_ == 0 ||
      top >= objectCount_ || tableOffset < kHeader || tableOffset > trailer ||
      objectCount_ > (trailer - tableOffset) / offsetSize_) {
    return malformed("bad binary trailer");
  }
  tableOffset_ = static_cast<size_t>(tableOffset);

  std::vector<Frame> stack;
  if (auto error = visit(top, false, &stack)) return error;
  while (!stack.empty()) {
    Frame& frame = stack.back();
    if (frame.left == 0) {
      stack.pop_back();
      continue;
    }
    const uint64_t ref = readInt(frame.refs, refSize_);
    const bool key = frame.keysLeft > 0;
    frame.refs += refSize_;
    --frame.left;
    if (key) --frame.keysLeft;
    if (auto error = visit(ref, key, &stack)) return error;  // may invalidate frame
  }
  return std::nullopt;
}

// ---------------------------------------------------------------------------
// libplist nodes to values.

class NodeReader {
 public:
  base::Result<Value> read(plist_t node, int depth);

 private:
  static Value integer(plist_t node);
  static base::Result<Value> date(plist_t node);
  base::Result<Value> array(plist_t node, int depth);
  base::Result<Value> dictionary(plist_t node, int depth);

  size_t objects_ = 0;
};

// The node as libplist writes it in XML, for what its API does not expose.
std::string nodeXml(plist_t node) {
  char* xml = nullptr;
  uint32_t length = 0;
  plist_to_xml(node, &xml, &length);
  std::string text = xml != nullptr ? std::string(xml, length) : std::string();
  plist_to_xml_free(xml);
  return text;
}

// libplist 2.2 hands every integer out as a uint64_t and keeps to itself
// whether it read the value as unsigned (a 128-bit binary integer, or an XML
// integer above INT64_MAX). Its XML writer shows the mark: such a value is
// written without a minus sign. Only values above INT64_MAX need the check.
Value NodeReader::integer(plist_t node) {
  uint64_t v = 0;
  plist_get_uint_val(node, &v);
  if (v <= static_cast<uint64_t>(INT64_MAX)) return Value::integer(static_cast<int64_t>(v));
  const std::string xml = nodeXml(node);
  const size_t at = xml.find("<integer>");
  const bool isUnsigned = at != std::string::npos && xml[at + 9] != '-';
  return isUnsigned ? Value::unsignedInteger(v) : Value::integer(static_cast<int64_t>(v));
}

// libplist 2.2 returns a date's seconds as an int32_t, and a date outside
// 1932-2069 comes back as INT32_MIN. Its XML text is right, so such a date is
// read from there (to the second).
base::Result<Value> NodeReader::date(plist_t node) {
  int32_t sec = 0, usec = 0;
  plist_get_date_val(node, &sec, &usec);
  if (sec != INT32_MIN) return Value(lmo::Date{sec + usec / 1e6 + kSecondsFrom1970To2001});
  const std::string xml = nodeXml(node);
  const size_t at = xml.find("<date>");
  struct tm tm {};
  if (at == std::string::npos ||
      strptime(xml.c_str() + at + 6, "%Y-%m-%dT%H:%M:%SZ", &tm) == nullptr) {
    return malformed("unreadable date");
  }
  return Value(lmo::Date{static_cast<double>(timegm(&tm))});
}

base::Result<Value> NodeReader::array(plist_t node, int depth) {
  const uint32_t size = plist_array_get_size(node);
  std::vector<Value> items;
  items.reserve(std::min<size_t>(size, kMaxPropertyListObjects));
  for (uint32_t i = 0; i < size; ++i) {
    items.push_back(VT_TRY(read(plist_array_get_item(node, i), depth + 1)));
  }
  return Value(lmo::Array(std::move(items)));
}

base::Result<Value> NodeReader::dictionary(plist_t node, int depth) {
  std::vector<lmo::Dictionary::Entry> entries;
  plist_dict_iter iter = nullptr;
  plist_dict_new_iter(node, &iter);
  std::unique_ptr<void, decltype(&std::free)> iterOwner(iter, &std::free);
  while (true) {
    char* key = nullptr;
    plist_t child = nullptr;
    plist_dict_next_item(node, iter, &key, &child);
    if (child == nullptr) {
      std::free(key);
      break;
    }
    std::string name(key != nullptr ? key : "");
    std::free(key);
    auto value = read(child, depth + 1);
    if (!value.has_value()) return value.error();
    entries.emplace_back(std::move(name), std::move(value).value());
  }
  return Value(lmo::Dictionary::fromEntries(std::move(entries)));
}

base::Result<Value> NodeReader::read(plist_t node, int depth) {
  if (++objects_ > kMaxPropertyListObjects) return tooManyObjects();
  switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
      uint8_t b = 0;
      plist_get_bool_val(node, &b);
      return Value::boolean(b != 0);
    }
    case PLIST_UINT:
      return integer(node);
    case PLIST_UID: {
      uint64_t uid = 0;
      plist_get_uid_val(node, &uid);
      return Value::unsignedInteger(uid);
    }
    case PLIST_REAL: {
      double d = 0;
      plist_get_real_val(node, &d);
      return Value::real(d);
    }
    case PLIST_STRING: {
      char* s = nullptr;
      plist_get_string_val(node, &s);
      Value v(std::string(s != nullptr ? s : ""));
      std::free(s);
      return v;
    }
    case PLIST_DATA: {
      char* bytes = nullptr;
      uint64_t length = 0;
      plist_get_data_val(node, &bytes, &length);
      Value v = Value::data(bytes, bytes != nullptr ? length : 0);
      std::free(bytes);
      return v;
    }
    case PLIST_DATE:
      return date(node);
    case PLIST_ARRAY:
    case PLIST_DICT:
      if (depth >= kMaxPropertyListDepth) return tooDeep();
      return plist_get_node_type(node) == PLIST_ARRAY ? array(node, depth)
                                                      : dictionary(node, depth);
    default:
      return malformed("unsupported object");
  }
}

// ---------------------------------------------------------------------------
// Values to libplist nodes.

base::Error unrepresentable(const char* what) {
  return plistError(kPropertyListUnrepresentable,
                    base::format("cannot write a property list: %s", what));
}

// XML 1.0 text: valid UTF-8 without NUL or control characters other than
// tab, line feed and carriage return. libplist writes other bytes as they
// are, which no XML reader accepts back.
bool isXmlText(const std::string& s) {
  for (size_t i = 0; i < s.size();) {
    const auto c = static_cast<unsigned char>(s[i]);
    if (c < 0x80) {
      if (c < 0x20 && c != '\t' && c != '\n' && c != '\r') return false;
      ++i;
      continue;
    }
    const size_t n = c >= 0xF0 ? 4 : c >= 0xE0 ? 3 : c >= 0xC2 ? 2 : 0;
    if (n == 0 || c > 0xF4 || i + n > s.size()) return false;
    uint32_t cp = c & (0x7F >> n);
    for (size_t k = 1; k < n; ++k) {
      const auto cc = static_cast<unsigned char>(s[i + k]);
      if ((cc & 0xC0) != 0x80) return false;
      cp = cp << 6 | (cc & 0x3F);
    }
    const uint32_t minimum = n == 2 ? 0x80 : n == 3 ? 0x800 : 0x10000;
    if (cp < minimum || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF) || cp == 0xFFFE ||
        cp == 0xFFFF) {
      return false;
    }
    i += n;
  }
  return true;
}

base::Result<PlistPtr> toNode(const Value& value, int depth);

base::Result<PlistPtr> dateNode(const lmo::Date& date) {
  const double since2001 = date.secondsSince1970 - kSecondsFrom1970To2001;
  double whole = std::floor(since2001);
  long usec = std::lround((since2001 - whole) * 1e6);
  if (usec >= 1000000) {
    whole += 1;
    usec = 0;
  }
  // libplist 2.2 takes the seconds as an int32_t.
  if (!std::isfinite(since2001) || whole <= INT32_MIN || whole > INT32_MAX) {
    return unrepresentable("date out of range");
  }
  return PlistPtr(plist_new_date(static_cast<int32_t>(whole), static_cast<int32_t>(usec)));
}

base::Result<PlistPtr> containerNode(const Value& value, int depth) {
  if (depth >= kMaxPropertyListDepth) return tooDeep();
  if (const lmo::Array* array = value.getIfArray()) {
    PlistPtr node(plist_new_array());
    for (const Value& item : *array) {
      plist_array_append_item(node.get(), VT_TRY(toNode(item, depth + 1)).release());
    }
    return node;
  }
  PlistPtr node(plist_new_dict());
  for (const auto& [key, item] : *value.getIfDictionary()) {
    if (!isXmlText(key)) return unrepresentable("key that is not XML text");
    plist_dict_set_item(node.get(), key.c_str(), VT_TRY(toNode(item, depth + 1)).release());
  }
  return node;
}

base::Result<PlistPtr> toNode(const Value& value, int depth) {
  switch (value.type()) {
    case Value::Type::kNull:
      return unrepresentable("null value");
    case Value::Type::kBoolean:
      return PlistPtr(plist_new_bool(*value.getIfBoolean() ? 1 : 0));
    case Value::Type::kInteger:
      // Signed values go in as their 64 bits, which libplist writes signed;
      // see the header for unsigned values above INT64_MAX.
      return PlistPtr(plist_new_uint(value.isUnsignedInteger()
                                         ? value.unsignedValue()
                                         : static_cast<uint64_t>(value.integerValue())));
    case Value::Type::kReal:
      return PlistPtr(plist_new_real(*value.getIfReal()));
    case Value::Type::kString:
      if (!isXmlText(*value.getIfString())) return unrepresentable("string that is not XML text");
      return PlistPtr(plist_new_string(value.getIfString()->c_str()));
    case Value::Type::kData: {
      const Value::Bytes& bytes = *value.getIfData();
      return PlistPtr(plist_new_data(reinterpret_cast<const char*>(bytes.data()), bytes.size()));
    }
    case Value::Type::kDate:
      return dateNode(*value.getIfDate());
    case Value::Type::kUuid:
      return PlistPtr(plist_new_string(value.getIfUuid()->string().c_str()));
    case Value::Type::kArray:
    case Value::Type::kDictionary:
      return containerNode(value, depth);
  }
  return unrepresentable("unknown value type");
}

bool isBinary(std::string_view bytes) {
  return bytes.substr(0, 8) == "bplist00";
}

base::Result<Value> parse(std::string_view bytes) {
  plist_t root = nullptr;
  if (isBinary(bytes)) {
    if (auto error = BinaryPreflight(bytes).run()) return *error;
    plist_from_bin(bytes.data(), static_cast<uint32_t>(bytes.size()), &root);
  } else {
    const std::string clean = VT_TRY(XmlPreflight(bytes).run());
    plist_from_xml(clean.data(), static_cast<uint32_t>(clean.size()), &root);
  }
  if (root == nullptr) return malformed("rejected by the parser");
  PlistPtr owner(root);
  return NodeReader().read(root, 0);
}

base::Error tooLarge(uint64_t size) {
  return plistError(kPropertyListTooLarge,
                    base::format("property list of %u bytes exceeds the limit of %u bytes", size,
                                 kMaxPropertyListBytes));
}

}  // namespace

base::Result<lmo::Value> readPropertyList(std::string_view bytes) {
  if (bytes.size() > kMaxPropertyListBytes) return tooLarge(bytes.size());
  if (bytes.empty()) return malformed("empty");
  return parse(bytes);
}

base::Result<lmo::Value> readPropertyListFile(const std::string& path) {
  // O_NONBLOCK: a FIFO in place of the file must not stall the reader.
  const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
  if (fd < 0) return posixError(errno, "cannot open", path);
  struct stat st;
  const int statError = ::fstat(fd, &st) != 0 ? errno : S_ISDIR(st.st_mode) ? EISDIR : 0;
  if (statError != 0) {
    ::close(fd);
    return posixError(statError, "cannot read", path);
  }
  if (S_ISREG(st.st_mode) && static_cast<uint64_t>(st.st_size) > kMaxPropertyListBytes) {
    ::close(fd);
    return tooLarge(static_cast<uint64_t>(st.st_size));
  }
  // Read at most one byte past the limit: the file may grow, or not be a
  // regular file at all.
  std::string bytes;
  char buffer[65536];
  while (bytes.size() <= kMaxPropertyListBytes) {
    const ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      const int err = errno;
      ::close(fd);
      return posixError(err, "cannot read", path);
    }
    if (n == 0) break;
    bytes.append(buffer, static_cast<size_t>(n));
  }
  ::close(fd);
  return readPropertyList(bytes);
}

base::Result<std::string> writePropertyListXML(const lmo::Value& value) {
  PlistPtr root = VT_TRY(toNode(value, 0));
  char* xml = nullptr;
  uint32_t length = 0;
  plist_to_xml(root.get(), &xml, &length);
  if (xml == nullptr) return unrepresentable("serialisation failed");
  std::string text(xml, length);
  plist_to_xml_free(xml);
  return text;
}

base::Result<void> writePropertyListFile(const std::string& path, const lmo::Value& value,
                                         mode_t mode) {
  const std::string xml = VT_TRY(writePropertyListXML(value));
  return writeFileAtomically(path, xml, mode);
}

}  // namespace vantrel::platform
