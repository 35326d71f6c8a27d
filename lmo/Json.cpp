#include "lmo/Json.h"

#include <charconv>
#include <cmath>
#include <ctime>

#include "lmo/Utf8.h"

namespace vantrel::lmo {
namespace {

constexpr int kMaxJsonDepth = 256;

void appendQuoted(std::string& out, std::string_view s) {
  out += '"';
  for (size_t i = 0; i < s.size();) {
    unsigned char c = static_cast<unsigned char>(s[i]);
    switch (c) {
      case '"':
        out += "\\\"";
        ++i;
        continue;
      case '\\':
        out += "\\\\";
        ++i;
        continue;
      case '\n':
        out += "\\n";
        ++i;
        continue;
      case '\r':
        out += "\\r";
        ++i;
        continue;
      case '\t':
        out += "\\t";
        ++i;
        continue;
      default:
        break;
    }
    if (c < 0x20) {
      char buf[8];
      std::snprintf(buf, sizeof buf, "\\u%04x", c);
      out += buf;
      ++i;
      continue;
    }
    size_t n = utf8SequenceLength(s, i);
    if (n == 0) {
      out += "\xEF\xBF\xBD";
      ++i;
    } else {
      out.append(s.substr(i, n));
      i += n;
    }
  }
  out += '"';
}

void appendBase64(std::string& out, const Value::Bytes& bytes) {
  static constexpr char kAlphabet[] =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  out += '"';
  size_t i = 0;
  for (; i + 2 < bytes.size(); i += 3) {
    uint32_t v = (bytes[i] << 16) | (bytes[i + 1] << 8) | bytes[i + 2];
    out += kAlphabet[v >> 18];
    out += kAlphabet[(v >> 12) & 63];
    out += kAlphabet[(v >> 6) & 63];
    out += kAlphabet[v & 63];
  }
  if (i < bytes.size()) {
    uint32_t v = bytes[i] << 16;
    if (i + 1 < bytes.size()) v |= bytes[i + 1] << 8;
    out += kAlphabet[v >> 18];
    out += kAlphabet[(v >> 12) & 63];
    out += i + 1 < bytes.size() ? kAlphabet[(v >> 6) & 63] : '=';
    out += '=';
  }
  out += '"';
}

class Writer {
 public:
  Writer(JsonStyle style, int indent) : pretty_(style == JsonStyle::kPretty), base_(indent) {}

  void write(const Value& v, int depth) {
    if (depth > kMaxJsonDepth) {
      out_ += "null";
      return;
    }
    switch (v.type()) {
      case Value::Type::kNull:
        out_ += "null";
        break;
      case Value::Type::kBoolean:
        out_ += *v.getIfBoolean() ? "true" : "false";
        break;
      case Value::Type::kInteger:
        out_ += v.isUnsignedInteger() ? std::to_string(v.unsignedValue())
                                      : std::to_string(v.integerValue());
        break;
      case Value::Type::kReal:
        writeReal(*v.getIfReal());
        break;
      case Value::Type::kString:
        appendQuoted(out_, *v.getIfString());
        break;
      case Value::Type::kData:
        appendBase64(out_, *v.getIfData());
        break;
      case Value::Type::kDate:
        appendQuoted(out_, describe(v));
        break;
      case Value::Type::kUuid:
        appendQuoted(out_, v.getIfUuid()->string());
        break;
      case Value::Type::kArray:
        writeArray(*v.getIfArray(), depth);
        break;
      case Value::Type::kDictionary:
        writeDictionary(*v.getIfDictionary(), depth);
        break;
    }
  }

  std::string take() { return std::move(out_); }

 private:
  void writeReal(double d) {
    if (!std::isfinite(d)) {
      out_ += "null";
      return;
    }
    char buf[64];
    auto res = std::to_chars(buf, buf + sizeof buf, d);
    std::string_view text(buf, static_cast<size_t>(res.ptr - buf));
    out_ += text;
    // Keep reals recognisable as reals.
    if (text.find_first_of(".eE") == std::string_view::npos) out_ += ".0";
  }

  void newline(int depth) {
    if (!pretty_) return;
    out_ += '\n';
    out_.append(static_cast<size_t>(base_ + 2 * depth), ' ');
  }

  void writeArray(const Array& a, int depth) {
    if (a.empty()) {
      out_ += "[]";
      return;
    }
    out_ += '[';
    bool first = true;
    for (const Value& e : a) {
      if (!first) out_ += ',';
      first = false;
      newline(depth + 1);
      write(e, depth + 1);
    }
    newline(depth);
    out_ += ']';
  }

  void writeDictionary(const Dictionary& d, int depth) {
    if (d.empty()) {
      out_ += "{}";
      return;
    }
    out_ += '{';
    bool first = true;
    for (const auto& [k, e] : d) {
      if (!first) out_ += ',';
      first = false;
      newline(depth + 1);
      appendQuoted(out_, k);
      out_ += pretty_ ? ": " : ":";
      write(e, depth + 1);
    }
    newline(depth);
    out_ += '}';
  }

  bool pretty_;
  int base_;
  std::string out_;
};

}  // namespace

std::string toJson(const Value& value, JsonStyle style, int indent) {
  Writer w(style, indent);
  w.write(value, 0);
  return w.take();
}

std::string jsonQuote(std::string_view text) {
  std::string out;
  appendQuoted(out, text);
  return out;
}

}  // namespace vantrel::lmo
