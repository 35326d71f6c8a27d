#include "platform/PropertyListChecks.h"

#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <vector>

#include "base/Format.h"
#include "lmo/Utf8.h"
#include "platform/PropertyListChecks.h"

namespace vantrel::platform::plist_checks {
namespace {

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
    if (name == "key") return malformed("key outside a dictionary");
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

// The integer as libplist must be given it, or nullopt when it is not one.
// Compat: libplist reads integers with strtoull's base 0, so leading zeros
// would make a decimal number octal ("010" is 8, "08" is 0); property lists
// are decimal, and the zeros are dropped before libplist sees them.
std::optional<std::string> canonicalInteger(std::string_view text) {
  std::string out;
  if (!text.empty() && (text[0] == '-' || text[0] == '+')) {
    if (text[0] == '-') out += '-';
    text.remove_prefix(1);
  }
  const bool negative = !out.empty();
  int base = 10;
  if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
    base = 16;
    out += "0x";
    text.remove_prefix(2);
  }
  if (text.empty() || !allOf(text, base == 16 ? isHexDigit : isDigit)) return std::nullopt;
  uint64_t magnitude = 0;
  const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), magnitude, base);
  if (ec != std::errc() || end != text.data() + text.size()) return std::nullopt;  // > UINT64_MAX
  if (negative && magnitude > uint64_t{1} << 63) return std::nullopt;
  if (base == 10) {
    const size_t first = text.find_first_not_of('0');
    text.remove_prefix(first == std::string_view::npos ? text.size() - 1 : first);
  }
  out += text;
  return out;
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
    if (name == "integer") {
      std::optional<std::string> integer = canonicalInteger(value);
      ok = integer.has_value();
      text = std::move(integer).value_or(std::string());
    } else {
      ok = name == "real" ? validReal(value) : validDate(value);
      text = std::string(value);
    }
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
  // Property lists are UTF-8 documents, and libplist copies whatever bytes
  // it finds into strings and keys that messages must carry as text.
  if (!lmo::isValidUtf8(in_)) return malformed("not UTF-8");
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
  // A root value without <plist> around it reads as if it had one; libplist
  // is handed the one form, so what it reads never depends on the wrapper.
  if (!out_.starts_with("<plist>")) return "<plist>" + out_ + "</plist>";
  return std::move(out_);
}

}  // namespace

base::Result<std::string> preflightXml(std::string_view input) {
  return XmlPreflight(input).run();
}

}  // namespace vantrel::platform::plist_checks
