// Enabling a plug-in for a host: the declaration to the service manager, the consent services
// that decide a keyboard's sandbox, and the busy check.
#include "ekd/EkDPlugInEnabling.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <utility>

#include "Ekora/EkBundle.h"
#include "Ekora/EkPlugInKeys.h"
#include "Ekora/EkProtocol.h"
#include "ekd/EkDPlugIn.h"
#include "ekd/EkDWyreClient.h"
#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"
#include "platform/paths/Directories.h"
#include "platform/privo/Consent.h"
#include "platform/stard/ServiceManager.h"

namespace ek {

namespace enabling {

namespace {

struct ProfileRow {
  std::string_view point;
  std::string_view profile;
};

// Chosen by the extension point of the plug-in dictionary the record was built with.
constexpr ProfileRow kStoredPointProfiles[] = {
    {"com.corvane.peekview.extension.preview", "peekviewd"},
    {"com.corvane.peekview.preview", "peekview-preview"},
    {"com.corvane.peekview.thumbnail", "peekview-thumbnail"},
    {"com.corvane.app.non-ui-extension", "sandpit-devtools"},
    {"com.corvane.app.non-ui-extension.multiple-instances", "sandpit-devtools"},
    {"com.corvane.callscreen.message-filter", "message-filter"},
};

}  // namespace

std::string_view sandboxProfileFor(std::string_view currentPoint, std::string_view storedPoint,
                                   bool requestsOpenAccess,
                                   const std::function<bool()>& keyboardNetworkGranted) {
  if (currentPoint == kKeyboardPoint) {
    // A keyboard runs with network access only when it asked for it and the user agreed.
    if (requestsOpenAccess && keyboardNetworkGranted && keyboardNetworkGranted()) {
      return kProfilePlugIn;
    }
    return kProfileKeyboard;
  }
  if (currentPoint == kNetworkFilterPoint) return kProfileNetworkFilter;
  for (const ProfileRow& row : kStoredPointProfiles) {
    if (storedPoint == row.point) return row.profile;
  }
  return kProfilePlugIn;
}

}  // namespace enabling

namespace {

namespace pk = plugin;
using namespace enabling;

constexpr int32_t kCodeEnableFailed = protocol::kErrorInvalidRequest;

constexpr std::string_view kHomeVariable = "HOME";
constexpr std::string_view kFixedHomeVariable = "QVFIXED_USER_HOME";
constexpr std::string_view kTmpDirVariable = "TMPDIR";
constexpr std::string_view kContainerTmp = "tmp";

constexpr std::string_view kLogNoDataContainer =
    "no data container for plug-in %@(%@) %{public}@ at %@";
constexpr std::string_view kLogRawWyreService = "raw WyreService=%@";
constexpr std::string_view kLogNoWyreService = "no WyreService for plug-in; database returned %@";
constexpr std::string_view kLogAssigningProfile =
    "assigning plug-in %@(%@) %{public}@ to %s sandbox";
constexpr std::string_view kLogAllowingHost =
    "allowing host %d %@ to use plug-in %@(%@) uuid=%{public}@ at %@";
constexpr std::string_view kLogNoExecPath =
    "failed to obtain execPath for plug-in %@(%{public}@) bundle=%@";
constexpr std::string_view kLogOverlay = "activation overlay=%@";
constexpr std::string_view kLogStardError =
    "stard error %d trying to allow %d %@ to use plug-in %@(%@) uuid=%{public}@ at %@";
constexpr std::string_view kLogNoBundle = "failed to create bundle for %@";
constexpr std::string_view kLogNoConsentInformation =
    "PrivoAccessCopyInformationForBundle failed for %@";
constexpr std::string_view kLogIncompleteInstance =
    "grantd reported incomplete bundle for plug-in %@/%{public}@";

constexpr std::string_view kErrorNoExecPath = "cannot obtain executable path for plug-in %@(%@)";
constexpr std::string_view kErrorEnableFailed = "unable to enable plug-in %@(%@)";

std::string logText(const Value* value) {
  if (value == nullptr) return "(null)";
  if (const std::string* text = value->string()) return *text;
  return value->description();
}

// A variable every process environment can carry and the declaration file can hold: a name
// without "=" and neither part with a NUL byte or anything the dmap writer refuses (invalid
// UTF-8, control characters). A host that sends anything else simply does not get it through.
bool carriable(std::string_view name, std::string_view value) {
  if (name.empty() || name.find('=') != std::string_view::npos ||
      name.find('\0') != std::string_view::npos || value.find('\0') != std::string_view::npos) {
    return false;
  }
  return dmap::write(Value(Dictionary{{std::string(name), Value(value)}})).ok();
}

// Copies the string entries of source that a process environment can carry into environment,
// replacing entries of the same name.
void addVariables(Dictionary& environment, const Dictionary& source) {
  for (const auto& [name, value] : source) {
    const std::string* text = value.string();
    if (text == nullptr || !carriable(name, *text)) continue;
    environment.insert_or_assign(name, Value(*text));
  }
}

std::string_view stringOr(const ValueRef& value, std::string_view fallback = {}) {
  if (value && value->string() != nullptr) return *value->string();
  return fallback;
}

}  // namespace

std::optional<EkError> EkDPlugIn::enableForClient(const EkDClientProcess& client,
                                                  const Dictionary* environment) const {
  const std::string plugInIdentifier = identifier().value_or("(null)");
  const ValueRef plugInVersion = version();
  const std::string versionText = logText(plugInVersion.get());
  const std::string uuidText = uuid().string();
  const std::string plugInPath = path().value_or("(null)");

  // Later sources win: the host's environment, the data container, the daemon's test SDK,
  // then the plug-in's own variables.
  Dictionary variables;
  if (environment != nullptr) addVariables(variables, *environment);

  if (const std::optional<EkFileURL>& container = dataContainerURL()) {
    const std::string& home = container->path();
    variables.insert_or_assign(std::string(kHomeVariable), Value(home));
    variables.insert_or_assign(std::string(kFixedHomeVariable), Value(home));
    variables.insert_or_assign(std::string(kTmpDirVariable),
                               Value(paths::join(home, kContainerTmp)));
  } else {
    log::ops().debug(kLogNoDataContainer, plugInIdentifier, versionText, uuidText, plugInPath);
  }

  if (const char* sdk = std::getenv(std::string(kTestSdkVariable).c_str())) {
    if (carriable(kTestSdkVariable, sdk)) {
      variables.insert_or_assign(std::string(kTestSdkVariable), Value(sdk));
    }
  }

  Dictionary service;
  ValueRef declared = infoKey(kWyreService);
  if (declared && declared->dictionary() != nullptr) {
    log::vr().debug(kLogRawWyreService, *declared);
    service = *declared->dictionary();
  } else {
    log::ops().info(kLogNoWyreService, logText(declared.get()));
  }
  if (auto own = service.find(kEnvironmentVariables); own != service.end()) {
    if (const Dictionary* ownVariables = own->second.dictionary()) {
      addVariables(variables, *ownVariables);
    }
  }
  service.insert_or_assign(std::string(kEnvironmentVariables), Value(std::move(variables)));

  // Keyboards and network filters are told by the registry's current dictionary, the other
  // profiles by the plug-in dictionary the record was built with.
  const ValueRef currentPoint = pluginKey(pk::kExtensionPointIdentifier);
  const DictionaryRef stored = plugInDictionary();
  std::string_view storedPoint;
  if (stored) {
    auto point = stored->find(pk::kExtensionPointIdentifier);
    if (point != stored->end() && point->second.string() != nullptr) {
      storedPoint = *point->second.string();
    }
  }
  const ValueRef requestsOpenAccess = attribute(kRequestsOpenAccess);
  const std::string_view profile =
      sandboxProfileFor(stringOr(currentPoint), storedPoint,
                        requestsOpenAccess && requestsOpenAccess->boolean() != nullptr &&
                            *requestsOpenAccess->boolean(),
                        [this] {
                          const std::vector<std::string> granted = allowedPrivoServices();
                          return std::find(granted.begin(), granted.end(),
                                           privo::kKeyboardNetworkService) != granted.end();
                        });
  service.insert_or_assign(std::string(kSandboxProfile), Value(profile));
  service.insert_or_assign(std::string(kOmitSandboxParameters), Value(true));
  log::ops().info(kLogAssigningProfile, plugInIdentifier, versionText, uuidText, profile);

  Dictionary overlay{{std::string(kWyreService), Value(std::move(service))},
                     {std::string(kPackageType), Value(kServicePackageType)}};

  log::ops().defaultLevel(kLogAllowingHost, client.pid(), client.path(), plugInIdentifier,
                          versionText, uuidText, plugInPath);

  std::shared_ptr<EkBundle> bundle;
  if (std::optional<EkFileURL> location = url()) bundle = EkBundle::initWithURL(*location);
  std::optional<std::string> program;
  // A bundle that declares no executable answers its own path: such a plug-in is still
  // declared, and the service manager judges what it can launch.
  if (bundle) program = bundle->executablePath();
  if (!program) {
    log::ops().error(kLogNoExecPath, plugInIdentifier, uuidText,
                     bundle ? bundle->path().value_or("(null)") : std::string("(null)"));
    return EkError::ekora(kCodeEnableFailed,
                          log::format(kErrorNoExecPath, plugInIdentifier, uuidText));
  }

  log::ops().debug(kLogOverlay, Value(overlay));

  const std::string bundleIdentifier(
      stringOr(infoKey(pk::kInfoBundleIdentifier), plugInIdentifier));
  const int result = context_.serviceManager
                         ? context_.serviceManager->addExternalService(
                               client.pid(), client.path(), bundleIdentifier, *program, overlay)
                         : ENOSYS;
  if (result != stard::kSuccess) {
    log::ops().error(kLogStardError, result, client.pid(), client.path(), plugInIdentifier,
                     versionText, uuidText, plugInPath);
    return EkError::ekora(kCodeEnableFailed,
                          log::format(kErrorEnableFailed, plugInIdentifier, uuidText));
  }
  return std::nullopt;
}

std::vector<std::string> EkDPlugIn::allowedPrivoServices() const {
  const std::optional<EkFileURL> application = containingUrl();
  if (!application) return {};
  // A fresh reader re-reads the application's info dictionary: nothing is cached.
  std::shared_ptr<EkBundle> bundle = EkBundle::initWithURL(*application);
  std::optional<std::string> applicationIdentifier;
  if (bundle) applicationIdentifier = bundle->bundleIdentifier();
  if (!applicationIdentifier) {
    log::ops().info(kLogNoBundle, path().value_or("(null)"));
    return {};
  }
  std::optional<std::vector<std::string>> granted;
  if (context_.consent)
    granted = context_.consent->informationForApplication(*applicationIdentifier);
  if (!granted) {
    log::ops().info(kLogNoConsentInformation, application->path());
    return {};
  }
  return std::move(*granted);
}

std::optional<Dictionary> EkDPlugIn::checkBusy() const {
  ValueRef declared = infoKey(pk::kInfoBundleIdentifier);
  if (!declared || declared->string() == nullptr || !context_.serviceManager) return std::nullopt;
  for (const stard::Instance& instance :
       context_.serviceManager->instances({*declared->string()})) {
    if (instance.bundleIdentifier.empty()) {
      log::ops().error(kLogIncompleteInstance, identifier().value_or("(null)"), uuid().string());
      continue;
    }
    return Dictionary{
        {std::string(kExtensionBundleIdentifierKey), Value(instance.bundleIdentifier)}};
  }
  return std::nullopt;
}

}  // namespace ek
