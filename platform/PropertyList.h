#pragma once
// Property-list files, read and written through libplist.
//
// Reading accepts XML and binary property lists and maps them onto lmo::Value:
// dict <-> Dictionary, array <-> Array, string, boolean, integer, real, data
// and date (stored by libplist as seconds since 2001-01-01, held here as
// seconds since 1970). Integers are signed unless a binary list marks one as
// unsigned above INT64_MAX; UID nodes (keyed-archive references) read as
// unsigned integers. Writing produces an XML 1.0 property list; a UUID writes
// as its canonical string, since property lists have no UUID type.
//
// Known limitations of libplist 2.2, which the tests pin so that a libplist
// upgrade that changes them is noticed:
// - It writes an unsigned integer above INT64_MAX as the negative number with
//   the same 64 bits, so such a value does not survive a write and read.
// - Its date API holds seconds since 2001 as an int32_t: dates before
//   1932-12-13 or after 2069-01-19 are read (to the second) but cannot be
//   written; writing one is error code 3.
// - XML dates hold whole seconds; a fraction is dropped when written.
// - Strings are C strings, so a string holding a NUL character cannot be read
//   (it is refused as malformed) or written (code 3).
// - Strings and keys are UTF-8 text, like every string of a message: a
//   binary list whose strings are not (an "ASCII" string with high bytes, a
//   lone UTF-16 surrogate) is refused as malformed.
//
// Every read is bounded and checked before libplist sees the bytes, since
// libplist 2.2 can be crashed by deep XML nesting and made to expand a small
// binary list into gigabytes: input above kMaxPropertyListBytes is refused,
// XML must follow the property-list grammar (libplist alone accepts "12abc" as
// 12) and nest at most kMaxPropertyListDepth containers, and a binary list's
// object graph is walked with its depth and expanded size bounded
// (kMaxPropertyListObjects).

#include <sys/types.h>

#include <cstddef>
#include <string>
#include <string_view>

#include "base/Result.h"
#include "lmo/Value.h"

namespace vantrel::platform {

inline constexpr const char* kPropertyListErrorDomain = "PropertyList";
inline constexpr size_t kMaxPropertyListBytes = 16 * 1024 * 1024;
inline constexpr int kMaxPropertyListDepth = 128;
// Values (containers and scalars) one read may produce. A binary list can
// reference one object from many places, so its expanded size is bounded
// separately from its byte size.
inline constexpr size_t kMaxPropertyListObjects = 1 << 21;

enum PropertyListErrorCode : int64_t {
  kPropertyListMalformed = 1,        // not a property list, or malformed
  kPropertyListTooLarge = 2,         // above kMaxPropertyListBytes or too deeply nested
  kPropertyListUnrepresentable = 3,  // a value with no property-list form (null)
};

// Reads an XML or binary property list held in memory. Errors: domain
// "PropertyList", code 1 (not a property list / malformed), 2 (too large or
// nested too deep).
base::Result<lmo::Value> readPropertyList(std::string_view bytes);

// Reads a file (XML or binary). I/O errors: domain "POSIX" with the errno as
// code and a description naming the path and strerror; a file above
// kMaxPropertyListBytes is refused (code 2) without being read whole.
base::Result<lmo::Value> readPropertyListFile(const std::string& path);

// Serialises a value as an XML 1.0 property list. Null anywhere inside, a
// string or key that is not XML text (invalid UTF-8, NUL or other control
// characters but tab, line feed and carriage return) or a date out of range
// (not representable) -> error domain "PropertyList" code 3; nesting deeper
// than kMaxPropertyListDepth -> code 2.
base::Result<std::string> writePropertyListXML(const lmo::Value& value);

// writePropertyListXML + writeFileAtomically: on any error the file at path
// is left as it was.
base::Result<void> writePropertyListFile(const std::string& path, const lmo::Value& value,
                                         mode_t mode = 0644);

}  // namespace vantrel::platform
