// Discovery: the election filter and findPlugIns.

#include "registry/Discovery.h"

#include <locale.h>
#include <wctype.h>

#include <algorithm>
#include <cstdint>
#include <unordered_set>

#include "base/Check.h"
#include "lmo/Protocol.h"
#include "registry/VTDAnnotationStore.h"
#include "registry/VTDPlugIn.h"
#include "registry/VTDatabase.h"

namespace vantrel::registry {

using lmo::Dictionary;
using lmo::Value;

namespace {

constexpr char kExactPrefix = '=';

// Combining marks count as alphanumeric, but glibc's classes leave most of
// them out; these are the general-purpose combining blocks it misses.
struct Range {
  char32_t first, last;
};
constexpr Range kCombiningMarks[] = {
    {0x0300, 0x036F}, {0x0483, 0x0489}, {0x0591, 0x05C7}, {0x0610, 0x061A}, {0x064B, 0x065F},
    {0x0900, 0x0903}, {0x093A, 0x094F}, {0x1AB0, 0x1AFF}, {0x1DC0, 0x1DFF}, {0x20D0, 0x20FF},
    {0x302A, 0x302F}, {0x3099, 0x309A}, {0xFE20, 0xFE2F},
};

// The first character of text as one UTF-16 unit: characters beyond the
// Basic Multilingual Plane start with a surrogate, which is no letter.
// nullopt for text that does not start with valid UTF-8.
std::optional<char32_t> firstUtf16Unit(std::string_view text) {
  const auto byte = [&](size_t i) { return static_cast<uint8_t>(text[i]); };
  const uint8_t lead = byte(0);
  if (lead < 0x80) return lead;
  if (lead < 0xC0 || lead >= 0xF8) return std::nullopt;  // a continuation or no lead byte
  const size_t length = lead >= 0xF0 ? 4 : lead >= 0xE0 ? 3 : 2;
  if (text.size() < length) return std::nullopt;
  char32_t c = lead & (0x7F >> length);
  for (size_t i = 1; i < length; ++i) {
    if ((byte(i) & 0xC0) != 0x80) return std::nullopt;
    c = (c << 6) | (byte(i) & 0x3F);
  }
  if (c > 0xFFFF) return char32_t{0xD800};  // the high surrogate's class
  return c;
}

bool isAlphanumeric(char32_t c) {
  if (c < 0x80) return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
  for (const Range& r : kCombiningMarks) {
    if (c >= r.first && c <= r.last) return true;
  }
  // A private locale object: the process's locale is never changed. Without
  // a UTF-8 locale on the machine only ASCII letters and digits qualify.
  static const locale_t utf8 = ::newlocale(LC_CTYPE_MASK, "C.UTF-8", locale_t{});
  return utf8 != locale_t{} && ::iswalnum_l(static_cast<wint_t>(c), utf8) != 0;
}

}  // namespace

std::optional<std::string> parse_election_value(const Value& value) {
  const std::string* text = value.getIfString();
  if (text == nullptr || text->empty()) return std::nullopt;
  if ((*text)[0] == kExactPrefix) return text->substr(1);
  std::optional<char32_t> first = firstUtf16Unit(*text);
  if (first && isAlphanumeric(*first)) return *text;
  return std::nullopt;
}

std::optional<std::vector<std::string>> electionFilterFor(const Value& value) {
  std::vector<std::string> filter;
  if (const lmo::Array* selectors = value.getIfArray()) {
    for (const Value& selector : *selectors) {
      std::optional<std::string> election = parse_election_value(selector);
      if (!election) return std::nullopt;  // one bad selector drops the whole filter
      filter.push_back(std::move(*election));
    }
    return filter;
  }
  if (value.getIfString() == nullptr) return std::nullopt;
  std::optional<std::string> election = parse_election_value(value);
  if (!election) return std::nullopt;
  filter.push_back(std::move(*election));
  return filter;
}

bool electionFilterAccepts(const std::vector<std::string>& filter, const std::string& identifier,
                           const Dictionary& entitlements, const VTDAnnotationStore& store) {
  // The annotation key rule of VTDPlugIn::annotationKey, on the registry's
  // data: a replacing plug-in is judged by the election of the one it
  // replaces.
  const std::string* replaced = entitlements.get(kReplacePlugInEntitlement).getIfString();
  const std::string& key = replaced ? *replaced : identifier;

  std::optional<Dictionary> annotation = store.annotationForIdentifier(key);
  Value election = annotation ? annotation->get(protocol::kAnnotationElection) : Value();
  if (election.isNull()) {
    // Only a number counts here: a string entitlement elects the plug-in
    // once its record is built (auto-election), not before.
    const Value& autoElect = entitlements.get(kAutoElectEntitlement);
    election = Value::integer(autoElect.isNumeric() && autoElect.boolValue() ? 1 : 0);
  }
  const std::string text = std::to_string(static_cast<uint8_t>(election.integerValue()));
  return std::find(filter.begin(), filter.end(), text) != filter.end();
}

std::optional<VTDatabase::PlugInList> VTDatabase::findPlugIns(
    const std::optional<Dictionary>& query) {
  VT_CHECK(!sync_.isCurrent(), "findPlugIns must not run on the database queue");
  std::optional<std::vector<omnidex::PlugInRecordPtr>> records;
  if (!query || query->empty()) {
    records = workspace_->installedPlugIns();
  } else {
    std::optional<std::vector<std::string>> filter =
        electionFilterFor(query->get(kUserElectionKey));
    const VTDAnnotationStorePtr store = annotations_;
    records = workspace_->plugInsMatchingQuery(
        *query, [&filter, &store](const std::string& identifier, const Dictionary& entitlements) {
          return !filter || electionFilterAccepts(*filter, identifier, entitlements, *store);
        });
  }
  if (!records) return std::nullopt;

  // The registry's records type the containing bundle as an application
  // record, so the check that it is one holds by construction.
  std::erase_if(*records, [](const omnidex::PlugInRecordPtr& record) {
    return !record || !record->bundlePath ||
           (record->containingApplication && record->containingApplication->placeholder);
  });
  PlugInList result;
  std::unordered_set<base::Uuid> seen;
  for (VTDPlugInPtr& plugIn : plugInsForProxies(*records)) {
    if (plugIn && seen.insert(*plugIn->uuid()).second) result.push_back(std::move(plugIn));
  }
  return result;
}

}  // namespace vantrel::registry
