#pragma once
// The metadata keys the plug-in model reads from a plug-in's three
// dictionaries, named once so that a misspelt key is a compile error.

#include <string_view>

namespace vantrel::model {

// Bundle info dictionary.
inline constexpr std::string_view kExtensionKey = "QXExtension";
inline constexpr std::string_view kOldStyleKey = "Vantrel";
inline constexpr std::string_view kShortVersionKey = "KBBundleShortVersionString";
inline constexpr std::string_view kInfoPlistUrlKey = "KBBundleInfoPlistURL";
inline constexpr std::string_view kBundleIdentifierKey = "KBBundleIdentifier";

// Extension dictionary.
inline constexpr std::string_view kMultipleKey = "Multiple";
inline constexpr std::string_view kAttributesKey = "QXExtensionAttributes";
inline constexpr std::string_view kProtocolKey = "QXExtensionProtocol";
inline constexpr std::string_view kPrincipalClassKey = "PrincipalClass";
inline constexpr std::string_view kExtensionPointKey = "QXExtensionPointIdentifier";
inline constexpr std::string_view kEmbeddedProtocolKey = "EmbeddedProtocol";
inline constexpr std::string_view kEmbeddedCodeKey = "EmbeddedCode";
inline constexpr std::string_view kDedicatedKey = "Dedicated";
inline constexpr std::string_view kPassProxyKey = "PassProxy";
inline constexpr std::string_view kSharedKey = "Shared";

// Merged at every level of an SDK merge.
inline constexpr std::string_view kCleanTimeoutKey = "CleanTimeout";

// Attributes dictionary.
inline constexpr std::string_view kVersionKey = "QXExtensionVersion";

// Protocol and principal class of an application extension that names none.
inline constexpr std::string_view kDefaultObjectClass = "QXObject";
// The protocol value that marks a data-only plug-in.
inline constexpr std::string_view kDataProtocol = "#Data";
// The version of a plug-in that declares none at all.
inline constexpr std::string_view kDefaultVersion = "1";
// Path suffix of an application extension bundle (case-sensitive).
inline constexpr std::string_view kAppExtensionSuffix = ".appex";

}  // namespace vantrel::model
