#include "base/Format.h"

#include <cinttypes>
#include <cstdio>

namespace vantrel::base {

int64_t FormatArg::asSigned() const {
  switch (kind_) {
    case Kind::kSigned:
      return s_;
    case Kind::kUnsigned:
    case Kind::kPointer:
      return static_cast<int64_t>(u_);
    case Kind::kReal:
      return static_cast<int64_t>(d_);
    default:
      return 0;
  }
}

uint64_t FormatArg::asUnsigned() const {
  switch (kind_) {
    case Kind::kSigned:
      return static_cast<uint64_t>(s_);
    case Kind::kUnsigned:
    case Kind::kPointer:
      return u_;
    case Kind::kReal:
      return static_cast<uint64_t>(d_);
    default:
      return 0;
  }
}

std::string FormatArg::asText() const {
  char buf[40];
  switch (kind_) {
    case Kind::kSigned:
      return std::to_string(s_);
    case Kind::kUnsigned:
      return std::to_string(u_);
    case Kind::kReal:
      std::snprintf(buf, sizeof buf, "%.17g", d_);
      return buf;
    case Kind::kPointer:
      std::snprintf(buf, sizeof buf, "0x%" PRIxPTR, static_cast<uintptr_t>(u_));
      return buf;
    case Kind::kNullText:
      return "(null)";
    case Kind::kText:
      return text_;
  }
  return {};
}

namespace {

// Renders one conversion; returns false for a conversion this formatter does
// not know, which the caller then copies literally.
bool render(char conv, const FormatArg& arg, std::string& out) {
  char buf[40];
  switch (conv) {
    case '@':
    case 's':
      out += arg.asText();
      return true;
    case 'd':
      if (arg.kind() == FormatArg::Kind::kText || arg.kind() == FormatArg::Kind::kNullText) {
        out += arg.asText();
      } else {
        out += std::to_string(arg.asSigned());
      }
      return true;
    case 'u':
      out += std::to_string(arg.asUnsigned());
      return true;
    case 'x':
      std::snprintf(buf, sizeof buf, "%" PRIx64, arg.asUnsigned());
      out += buf;
      return true;
    case 'p':
      std::snprintf(buf, sizeof buf, "0x%" PRIx64, arg.asUnsigned());
      out += buf;
      return true;
    default:
      return false;
  }
}

}  // namespace

std::string formatArgs(std::string_view fmt, const FormatArg* args, size_t count) {
  std::string out;
  out.reserve(fmt.size() + 16 * count);
  size_t next = 0;
  for (size_t i = 0; i < fmt.size(); ++i) {
    char c = fmt[i];
    if (c != '%' || i + 1 == fmt.size()) {
      out += c;
      continue;
    }
    size_t j = i + 1;
    if (fmt[j] == '%') {
      out += '%';
      i = j;
      continue;
    }
    while (j < fmt.size() && fmt[j] == 'l') ++j;  // %ld, %lu, %lx: width is ours anyway
    if (j == fmt.size()) {
      out.append(fmt.substr(i));
      break;
    }
    char conv = fmt[j];
    bool known =
        conv == '@' || conv == 's' || conv == 'd' || conv == 'u' || conv == 'x' || conv == 'p';
    if (!known) {
      out.append(fmt.substr(i, j - i + 1));
      i = j;
      continue;
    }
    if (next < count) {
      render(conv, args[next++], out);
    } else {
      out += "(missing)";
    }
    i = j;
  }
  return out;
}

}  // namespace vantrel::base
