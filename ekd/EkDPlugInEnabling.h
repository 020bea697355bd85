#pragma once

#include <functional>
#include <string_view>

// Names and the sandbox-profile choice used when a plug-in is enabled for a host.
namespace ek::enabling {

// The activation overlay handed to the service manager.
inline constexpr std::string_view kWyreService = "WyreService";
inline constexpr std::string_view kEnvironmentVariables = "EnvironmentVariables";
inline constexpr std::string_view kSandboxProfile = "_SandboxProfile";
inline constexpr std::string_view kOmitSandboxParameters = "_OmitSandboxParameters";
inline constexpr std::string_view kPackageType = "QvBundlePackageType";
inline constexpr std::string_view kServicePackageType = "WYR!";

// The service manager's property key for a running instance's bundle identifier, as checkBusy
// reports a busy instance.
inline constexpr std::string_view kExtensionBundleIdentifierKey = "StardExtensionBundleIdentifier";

// The keyboard attribute asking for network access.
inline constexpr std::string_view kRequestsOpenAccess = "RequestsOpenAccess";
// Variables taken from the daemon's own environment into every plug-in's.
inline constexpr std::string_view kTestSdkVariable = "EKTEST_SDK";

// Extension points with a sandbox profile of their own.
inline constexpr std::string_view kKeyboardPoint = "com.corvane.keyboard-service";
inline constexpr std::string_view kNetworkFilterPoint = "com.corvane.netguard.filter-data";

// Sandbox profile names; the platform's sandbox knows each of them.
inline constexpr std::string_view kProfilePlugIn = "plugin";
inline constexpr std::string_view kProfileKeyboard = "keyboard";
inline constexpr std::string_view kProfileNetworkFilter = "network-filter";

// The sandbox profile of a plug-in. currentPoint is the extension point identifier of the
// registry's current info dictionary (it decides keyboards and network filters), storedPoint
// the one of the plug-in dictionary the record was built with (it decides the rest); empty
// when there is none. keyboardNetworkGranted is asked only for a keyboard that requests open
// access.
std::string_view sandboxProfileFor(std::string_view currentPoint, std::string_view storedPoint,
                                   bool requestsOpenAccess,
                                   const std::function<bool()>& keyboardNetworkGranted);

}  // namespace ek::enabling
