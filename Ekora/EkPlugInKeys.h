#pragma once

#include "Ekora/EkProtocol.h"

// Keys and message texts of the plug-in record and its form. Protocol keys live elsewhere.

#include <cstdint>
#include <string_view>

namespace ek::plugin {

// Top level of a bundle's info dictionary.
inline constexpr std::string_view kInfoPlugInDictionary = "ZuExtension";
inline constexpr std::string_view kInfoOldStyleMarker = "Ekora";
inline constexpr std::string_view kInfoBundleIdentifier = "QvBundleIdentifier";
inline constexpr std::string_view kInfoShortVersionString = "QvBundleShortVersionString";
inline constexpr std::string_view kInfoDisplayName = "QvBundleDisplayName";
inline constexpr std::string_view kInfoBundleName = "QvBundleName";
inline constexpr std::string_view kInfoDmapURL = "QvBundleInfoDmapURL";

// Inside the plug-in dictionary ("ZuExtension").
inline constexpr std::string_view kAttributes = "ZuExtensionAttributes";
inline constexpr std::string_view kProtocol = "ZuExtensionProtocol";
inline constexpr std::string_view kPrincipalClass = "PrincipalClass";
inline constexpr std::string_view kExtensionPointIdentifier = "ZuExtensionPointIdentifier";
inline constexpr std::string_view kEmbeddedCode = "EmbeddedCode";
inline constexpr std::string_view kDedicated = "Dedicated";
inline constexpr std::string_view kPassProxy = "PassProxy";
inline constexpr std::string_view kMultiple = "Multiple";
inline constexpr std::string_view kHubProtocolVersion = "HubProtocolVersion";
inline constexpr std::string_view kShared = "Shared";
inline constexpr std::string_view kCleanTimeout = "CleanTimeout";
inline constexpr std::string_view kHostEntitlement = "ZuExtensionHostEntitlement";

// Inside the attributes ("ZuExtensionAttributes").
inline constexpr std::string_view kVersion = "ZuExtensionVersion";

// Values with a meaning of their own.
inline constexpr std::string_view kDefaultSpec = "ZuObject";
inline constexpr std::string_view kDataProtocol = "#Data";
inline constexpr std::string_view kAppExtensionSuffix = ".appex";
inline constexpr std::string_view kDefaultVersion = "1";
inline constexpr std::string_view kNoVersion = "<none>";

// The form: one plug-in record as it travels to a host.
namespace form {
inline constexpr std::string_view kHubProtocolVersion = "hubProtocolVersion";
inline constexpr std::string_view kPath = "path";
inline constexpr std::string_view kSystemResident = "systemResident";
inline constexpr std::string_view kIdentifier = "identifier";
inline constexpr std::string_view kOriginalIdentifier = "original-identifier";
inline constexpr std::string_view kVersion = "version";
inline constexpr std::string_view kBundleInfo = "bundleInfo";
inline constexpr std::string_view kInfo = "info";
inline constexpr std::string_view kUuid = "uuid";
inline constexpr std::string_view kLastModified = "lastmodified";
inline constexpr std::string_view kAnnotations = "annotations";
inline constexpr std::string_view kEntitlements = "entitlements";
inline constexpr std::string_view kContainingPath = "containingPath";
inline constexpr std::string_view kLocalizedContainingDisplayName =
    "localizedContainingDisplayName";
inline constexpr std::string_view kLocalizedDisplayName = "localizedDisplayName";
inline constexpr std::string_view kLocalizedShortName = "localizedShortName";
inline constexpr std::string_view kLocalizedFileProviderActionNames =
    "localizedFileProviderActionNames";
inline constexpr std::string_view kHash = "hash";
inline constexpr std::string_view kRequirement = "requirement";
// Added after export by the daemon before a form is sent.
inline constexpr std::string_view kExtensions = "extensions";
inline constexpr std::string_view kServiceExtension = "service-extension";
inline constexpr std::string_view kOverrider = "overrider";
inline constexpr std::string_view kOverriding = "overriding";
}  // namespace form

// Error codes of the "Ekora" domain used by the record.
inline constexpr int32_t kCodeUnresolved = protocol::kErrorUnresolved;
inline constexpr int32_t kCodeNotCarriedOut = protocol::kErrorInvalidRequest;
inline constexpr int32_t kCodeInvalidDefinition = protocol::kErrorInvalidPlugIn;

// Validation messages (code 12).
inline constexpr std::string_view kMissingIdentifierMessage =
    "missing identifier (no ZuExtensionIdentifier, nor even QvBundleIdentifier)";
inline constexpr std::string_view kMissingKeyFormat = "missing \"%@\" key in Info.dmap or SDK";
inline constexpr std::string_view kAppExtensionKeyFormat =
    "Application Extensions may not use the \"%@\" key";
inline constexpr std::string_view kUnsupportedKeyFormat =
    "the \"%@\" key is not supported on this platform";
inline constexpr std::string_view kHybridMessage =
    "hybrid plug-ins are not supported on this platform";

// Localized lookup (code -1).
inline constexpr std::string_view kUnresolvedFormat = "Unable to resolve plugin for %@";
inline constexpr std::string_view kNotSecureCodingFormat =
    "Value of info dictionary key \"%@\" for plugin %@ does not conform to secure coding!";

// An export that cannot write every base key (code 4); the argument lists the missing keys.
inline constexpr std::string_view kIncompleteFormFormat =
    "incomplete form for plug-in %@: missing %s";

// Broken invariants.
inline constexpr std::string_view kMissingUuidCondition = "self.uuid";
inline constexpr std::string_view kResolveWithoutInfoMessage =
    "cannot resolve SDK without materialized Info.dmap";

// Log lines.
inline constexpr std::string_view kLogMissingIdentifier = "missing identifier in plug-in at %@";
inline constexpr std::string_view kLogMalformedDictionary =
    "malformed plug-in dictionary in plug-in %@ at %@: %@";
inline constexpr std::string_view kLogOperationName = "%s %@";
inline constexpr std::string_view kLogMultipleObsolete =
    "multiplexed plug-ins (%{public}@ key) obsolete and ignored";
inline constexpr std::string_view kLogInfoKey = "%s %@ => %@";
inline constexpr std::string_view kLogInvalidSdkKey = "invalid SDK key:%{public}@";
inline constexpr std::string_view kLogMergedWithSdk = "%s %@ merged with SDK";
inline constexpr std::string_view kLogSdkNotRegistered =
    "plug-in sdk \"%{public}@\" not registered";
inline constexpr std::string_view kLogDisplayNameWas = "%s BundleInfo[BundleDisplayName] was %@";
inline constexpr std::string_view kLogDisplayNameIs = "%s BundleInfo[BundleDisplayName] is %@";
inline constexpr std::string_view kLogLocalizedValues = "localized values %@";

}  // namespace ek::plugin
