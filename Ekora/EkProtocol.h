#pragma once

#include <cstdint>
#include <string_view>

// Keys, request types, codes and messages of the daemon's wire protocol, shared by the
// daemon and its clients so that neither can drift from the other.
namespace ek::protocol {

inline constexpr std::string_view kServiceName = "com.corvane.ekora.ekd";
inline constexpr uint64_t kCurrentVersion = 3;
inline constexpr uint64_t kOldestVersion = 2;

// Request keys.
inline constexpr std::string_view kRequest = "request";
inline constexpr std::string_view kVersion = "version";
inline constexpr std::string_view kFlags = "flags";
inline constexpr std::string_view kPaths = "paths";
inline constexpr std::string_view kUuids = "uuids";
inline constexpr std::string_view kAnnotations = "annotations";
inline constexpr std::string_view kRules = "rules";
inline constexpr std::string_view kEnvironment = "environment";

// Reply keys.
inline constexpr std::string_view kErrorCode = "errorcode";
inline constexpr std::string_view kError = "error";
inline constexpr std::string_view kMatches = "matches";
inline constexpr std::string_view kExtensions = "extensions";
inline constexpr std::string_view kConflicts = "conflicts";

// Request types.
inline constexpr std::string_view kAdd = "add";
inline constexpr std::string_view kRemove = "remove";
inline constexpr std::string_view kBulk = "bulk";
inline constexpr std::string_view kMatch = "match";
inline constexpr std::string_view kReady = "ready";
inline constexpr std::string_view kAccess = "access";
inline constexpr std::string_view kAnnotate = "annotate";
inline constexpr std::string_view kBulkAnnotate = "bulk-annotate";
inline constexpr std::string_view kLock = "lock";
inline constexpr std::string_view kFind = "find";
// The daemon's own state, for administrators; no plug-in is involved.
inline constexpr std::string_view kStatus = "status";

// Discovery flags of "match".
inline constexpr uint64_t kDiscoverKeepVersions = 0x1;
inline constexpr uint64_t kDiscoverKeepDuplicates = 0x4;
inline constexpr uint64_t kDiscoverSystemOnly = 0x8;
inline constexpr uint64_t kDiscoverAll = 0x200;

// Error codes.
inline constexpr int32_t kErrorUnresolved = -1;
inline constexpr int32_t kErrorRegistry = 2;
inline constexpr int32_t kErrorInvalidRequest = 4;
inline constexpr int32_t kErrorVersion = 7;
inline constexpr int32_t kErrorBadPath = 9;
inline constexpr int32_t kErrorNotPermitted = 11;
inline constexpr int32_t kErrorInvalidPlugIn = 12;
inline constexpr int32_t kErrorBusy = 14;
inline constexpr int32_t kErrorNotFound = 15;
inline constexpr int32_t kErrorBadAnnotation = 18;

// Messages of the frame.
inline constexpr std::string_view kMsgUnsupportedVersion =
    "unsupported protocol version %d (current %d)";
inline constexpr std::string_view kMsgInvalidFormat = "invalid request format";
inline constexpr std::string_view kMsgMissingType = "invalid request format (missing type)";
inline constexpr std::string_view kMsgUnrecognized = "unrecognized request";
inline constexpr std::string_view kMsgAbsolutePathRequired = "absolute path required: %s";
inline constexpr std::string_view kMsgUnknownError = "unknown error returned by Ekora subsystem";
inline constexpr std::string_view kMsgErrorWithoutCode = "ekd reported error without a code: %s";

// Limits of one request and one reply.
inline constexpr size_t kMaxListEntries = 10000;  // "paths", "uuids"
inline constexpr std::string_view kMsgTooManyEntries =
    "invalid request format (%s: %zu entries, at most %zu)";
inline constexpr std::string_view kMsgReplyTooLarge =
    "reply of %zu bytes exceeds the frame limit of %u bytes";

// Entitlements.
inline constexpr std::string_view kEntitlementManager = "com.corvane.private.ekora.manager";
inline constexpr std::string_view kEntitlementAllowedPlugIns =
    "com.corvane.developer.ekora.allowedplugins";
inline constexpr std::string_view kEntitlementProvideEnvironment =
    "com.corvane.developer.ekora.provide-environment";
inline constexpr std::string_view kEntitlementReplacePlugIn =
    "com.corvane.developer.replace-plugin";
inline constexpr std::string_view kEntitlementAutoElect = "com.corvane.developer.auto-elect-plugin";

// System-wide notifications.
inline constexpr std::string_view kAnnotationChangeNotification =
    "com.corvane.ekora.annotation-change";

}  // namespace ek::protocol
