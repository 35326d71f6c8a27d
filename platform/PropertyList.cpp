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

#include "lmo/Utf8.h"
#include "platform/AtomicFile.h"
#include "platform/PropertyListChecks.h"

namespace vantrel::platform {
namespace {

using lmo::Value;

// libplist keeps dates as seconds since 2001-01-01 00:00:00 UTC.
constexpr double kSecondsFrom1970To2001 = 978307200.0;

using plist_checks::malformed;
using plist_checks::plistError;
using plist_checks::tooDeep;
using plist_checks::tooManyObjects;

struct PlistFree {
  void operator()(plist_t node) const { plist_free(node); }
};
using PlistPtr = std::unique_ptr<void, PlistFree>;

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

// A binary list's ASCII strings are copied byte for byte and its UTF-16
// ones converted without checking surrogates, so either can come out of
// libplist as text that is not UTF-8, which no message may carry.
base::Error notText() {
  return malformed("a string or key that is not UTF-8");
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
    if (!lmo::isValidUtf8(name)) return notText();
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
      std::string text(s != nullptr ? s : "");
      std::free(s);
      if (!lmo::isValidUtf8(text)) return notText();
      return Value(std::move(text));
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
  // Only XML is written, and XML keeps whole seconds: the fraction is
  // dropped here, since libplist rounds the seconds it prints.
  const double whole = std::floor(since2001);
  // libplist 2.2 takes the seconds as an int32_t.
  if (!std::isfinite(since2001) || whole <= INT32_MIN || whole > INT32_MAX) {
    return unrepresentable("date out of range");
  }
  return PlistPtr(plist_new_date(static_cast<int32_t>(whole), 0));
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
    if (auto error = plist_checks::preflightBinary(bytes)) return *error;
    plist_from_bin(bytes.data(), static_cast<uint32_t>(bytes.size()), &root);
  } else {
    const std::string clean = VT_TRY(plist_checks::preflightXml(bytes));
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