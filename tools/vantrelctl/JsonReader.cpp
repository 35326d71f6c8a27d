#include "tools/vantrelctl/JsonReader.h"

#include <cerrno>
#include <cmath>
#include <cstdlib>
#include <optional>
#include <vector>

#include "base/Format.h"
#include "lmo/Protocol.h"

namespace vantrel::ctl {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;

class Reader {
 public:
  explicit Reader(std::string_view text) : text_(text) {}

  base::Result<Value> document() {
    skipSpace();
    std::optional<Value> value = parseValue(1);
    if (!value) return failure();
    skipSpace();
    if (pos_ != text_.size()) {
      fail("unexpected text after the value");
      return failure();
    }
    return *value;
  }

 private:
  base::Error failure() const {
    return base::error_with_code_and_format(protocol::kErrorBadRequest, "%@ at byte %u", error_,
                                            static_cast<uint64_t>(errorAt_));
  }
  // Records the first fault only: callers unwind with nullopt.
  std::nullopt_t fail(const char* what) { return failAt(what, pos_); }
  std::nullopt_t failAt(const char* what, size_t at) {
    if (error_.empty()) {
      error_ = what;
      errorAt_ = at;
    }
    return std::nullopt;
  }

  bool atEnd() const { return pos_ >= text_.size(); }
  char peek() const { return atEnd() ? '\0' : text_[pos_]; }
  void skipSpace() {
    while (!atEnd() && (peek() == ' ' || peek() == '\t' || peek() == '\n' || peek() == '\r'))
      ++pos_;
  }
  bool consume(std::string_view word) {
    if (text_.substr(pos_, word.size()) != word) return false;
    pos_ += word.size();
    return true;
  }

  std::optional<Value> parseValue(size_t depth) {
    if (atEnd()) return fail("unexpected end of input");
    switch (peek()) {
      case '{':
        return parseObject(depth);
      case '[':
        return parseArray(depth);
      case '"': {
        std::optional<std::string> s = parseString();
        if (!s) return std::nullopt;
        return Value(std::move(*s));
      }
      case 't':
        if (consume("true")) return Value::boolean(true);
        break;
      case 'f':
        if (consume("false")) return Value::boolean(false);
        break;
      case 'n':
        if (consume("null")) return Value();
        break;
      default:
        if (peek() == '-' || (peek() >= '0' && peek() <= '9')) return parseNumber();
    }
    return fail("unexpected character");
  }

  std::optional<Value> parseObject(size_t depth) {
    if (depth > kMaxJsonDepth) return fail("nested too deeply");
    ++pos_;
    std::vector<Dictionary::Entry> entries;
    skipSpace();
    if (peek() == '}') {
      ++pos_;
      return Value(Dictionary());
    }
    for (;;) {
      skipSpace();
      if (peek() != '"') return fail(atEnd() ? "unexpected end of input" : "expected a string key");
      const size_t keyAt = pos_;
      std::optional<std::string> key = parseString();
      if (!key) return std::nullopt;
      for (const Dictionary::Entry& e : entries) {
        if (e.first == *key) return failAt("repeated key", keyAt);
      }
      skipSpace();
      if (peek() != ':') return fail("expected ':'");
      ++pos_;
      skipSpace();
      std::optional<Value> value = parseValue(depth + 1);
      if (!value) return std::nullopt;
      entries.emplace_back(std::move(*key), std::move(*value));
      skipSpace();
      if (peek() == ',') {
        ++pos_;
        continue;
      }
      if (peek() == '}') {
        ++pos_;
        return Value(Dictionary::fromEntries(std::move(entries)));
      }
      return fail(atEnd() ? "unexpected end of input" : "expected ',' or '}'");
    }
  }

  std::optional<Value> parseArray(size_t depth) {
    if (depth > kMaxJsonDepth) return fail("nested too deeply");
    ++pos_;
    std::vector<Value> items;
    skipSpace();
    if (peek() == ']') {
      ++pos_;
      return Value(Array());
    }
    for (;;) {
      skipSpace();
      std::optional<Value> value = parseValue(depth + 1);
      if (!value) return std::nullopt;
      items.push_back(std::move(*value));
      skipSpace();
      if (peek() == ',') {
        ++pos_;
        continue;
      }
      if (peek() == ']') {
        ++pos_;
        return Value(Array(std::move(items)));
      }
      return fail(atEnd() ? "unexpected end of input" : "expected ',' or ']'");
    }
  }

  std::optional<unsigned> hex4() {
    if (text_.size() - pos_ < 4) return fail("truncated \\u escape");
    unsigned v = 0;
    for (int i = 0; i < 4; ++i) {
      const char c = text_[pos_ + i];
      v <<= 4;
      if (c >= '0' && c <= '9')
        v |= unsigned(c - '0');
      else if (c >= 'a' && c <= 'f')
        v |= unsigned(c - 'a' + 10);
      else if (c >= 'A' && c <= 'F')
        v |= unsigned(c - 'A' + 10);
      else
        return failAt("bad \\u escape", pos_ + i);
    }
    pos_ += 4;
    return v;
  }

  static void appendUtf8(std::string& out, unsigned cp) {
    if (cp < 0x80) {
      out += char(cp);
    } else if (cp < 0x800) {
      out += char(0xC0 | (cp >> 6));
      out += char(0x80 | (cp & 0x3F));
    } else if (cp < 0x10000) {
      out += char(0xE0 | (cp >> 12));
      out += char(0x80 | ((cp >> 6) & 0x3F));
      out += char(0x80 | (cp & 0x3F));
    } else {
      out += char(0xF0 | (cp >> 18));
      out += char(0x80 | ((cp >> 12) & 0x3F));
      out += char(0x80 | ((cp >> 6) & 0x3F));
      out += char(0x80 | (cp & 0x3F));
    }
  }

  // The length of the UTF-8 sequence at pos_, or 0 when it is not valid.
  size_t utf8Length() const {
    const auto byte = [&](size_t i) { return static_cast<unsigned char>(text_[pos_ + i]); };
    const unsigned char c = byte(0);
    size_t n = c < 0x80             ? 1
               : (c & 0xE0) == 0xC0 ? 2
               : (c & 0xF0) == 0xE0 ? 3
               : (c & 0xF8) == 0xF0 ? 4
                                    : 0;
    if (n == 0 || text_.size() - pos_ < n) return 0;
    unsigned cp = n == 1 ? c : n == 2 ? (c & 0x1F) : n == 3 ? (c & 0x0F) : (c & 0x07);
    for (size_t i = 1; i < n; ++i) {
      if ((byte(i) & 0xC0) != 0x80) return 0;
      cp = (cp << 6) | (byte(i) & 0x3F);
    }
    static constexpr unsigned kMin[] = {0, 0, 0x80, 0x800, 0x10000};
    if (cp < kMin[n] || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF)) return 0;
    return n;
  }

  std::optional<std::string> parseString() {
    ++pos_;  // the opening quote
    std::string out;
    for (;;) {
      if (atEnd()) return fail("unterminated string");
      const char c = peek();
      if (c == '"') {
        ++pos_;
        return out;
      }
      if (static_cast<unsigned char>(c) < 0x20) return fail("control character in string");
      if (c != '\\') {
        const size_t n = utf8Length();
        if (n == 0) return fail("invalid UTF-8 in string");
        out.append(text_.substr(pos_, n));
        pos_ += n;
        continue;
      }
      const size_t escapeAt = pos_;
      ++pos_;
      const char e = peek();
      ++pos_;
      switch (e) {
        case '"':
          out += '"';
          break;
        case '\\':
          out += '\\';
          break;
        case '/':
          out += '/';
          break;
        case 'b':
          out += '\b';
          break;
        case 'f':
          out += '\f';
          break;
        case 'n':
          out += '\n';
          break;
        case 'r':
          out += '\r';
          break;
        case 't':
          out += '\t';
          break;
        case 'u': {
          std::optional<unsigned> cp = hex4();
          if (!cp) return std::nullopt;
          if (*cp >= 0xDC00 && *cp <= 0xDFFF) return failAt("lone low surrogate", escapeAt);
          if (*cp >= 0xD800 && *cp <= 0xDBFF) {
            if (!consume("\\u")) return failAt("high surrogate without its low half", escapeAt);
            std::optional<unsigned> low = hex4();
            if (!low) return std::nullopt;
            if (*low < 0xDC00 || *low > 0xDFFF) {
              return failAt("high surrogate without its low half", escapeAt);
            }
            *cp = 0x10000 + ((*cp - 0xD800) << 10) + (*low - 0xDC00);
          }
          appendUtf8(out, *cp);
          break;
        }
        default:
          return failAt("bad escape", escapeAt);
      }
    }
  }

  std::optional<Value> parseNumber() {
    const size_t start = pos_;
    const auto digits = [&] {
      const size_t from = pos_;
      while (peek() >= '0' && peek() <= '9') ++pos_;
      return pos_ - from;
    };
    bool integral = true;
    if (peek() == '-') ++pos_;
    if (peek() == '0') {
      ++pos_;
      if (peek() >= '0' && peek() <= '9') return fail("leading zero in number");
    } else if (digits() == 0) {
      return fail("expected a digit");
    }
    if (peek() == '.') {
      integral = false;
      ++pos_;
      if (digits() == 0) return fail("expected a digit");
    }
    if (peek() == 'e' || peek() == 'E') {
      integral = false;
      ++pos_;
      if (peek() == '+' || peek() == '-') ++pos_;
      if (digits() == 0) return fail("expected a digit");
    }
    const std::string number(text_.substr(start, pos_ - start));
    if (integral) {
      errno = 0;
      char* end = nullptr;
      if (number[0] == '-') {
        const long long v = std::strtoll(number.c_str(), &end, 10);
        if (errno == 0) return Value::integer(v);
      } else {
        const unsigned long long v = std::strtoull(number.c_str(), &end, 10);
        if (errno == 0) return Value::unsignedInteger(v);
      }
    }
    const double d = std::strtod(number.c_str(), nullptr);
    if (!std::isfinite(d)) return failAt("number out of range", start);
    return Value::real(d);
  }

  std::string_view text_;
  size_t pos_ = 0;
  std::string error_;
  size_t errorAt_ = 0;
};

}  // namespace

base::Result<lmo::Value> readJson(std::string_view text) {
  return Reader(text).document();
}

}  // namespace vantrel::ctl
