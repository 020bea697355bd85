#include "ekd/EkDPlugIn.h"

#include <cerrno>
#include <cmath>
#include <filesystem>
#include <limits>
#include <set>
#include <stdexcept>
#include <system_error>
#include <vector>

#include "Ekora/EkPlugInKeys.h"
#include "Ekora/EkProtocol.h"
#include "Ekora/EkSandboxExtension.h"
#include "platform/codesign/CodeSigning.h"
#include "platform/log/Log.h"
#include "platform/paths/Directories.h"

namespace ek {

namespace pk = plugin;

namespace {

constexpr std::string_view kFileProviderActions = "ZuExtensionFileProviderActions";
constexpr std::string_view kFileProviderActionName = "ZuExtensionFileProviderActionName";
constexpr std::string_view kLocalizableTable = "Localizable";
constexpr std::string_view kBundleItself = ".";

constexpr std::string_view kNoDataContainerMessage = "this plug-in has no sandbox data container";
constexpr std::string_view kOutsideSystemMessage =
    "plug-ins outside containing apps must be in /System";

constexpr std::string_view kLogMisconfigured = "ignoring mis-configured plug-in at %@: %{public}@";
constexpr std::string_view kLogNoFreshProxy = "could not obtain fresh proxy for %@";
constexpr std::string_view kLogProxyFallback =
    "Failed to find Plugin by %{uuid_t}.16P fallback to path %@";
constexpr std::string_view kLogMissingActionName =
    "missing ZuExtensionFileProviderActionName for plugin %@";
constexpr std::string_view kLogResourceExtensionFailed =
    "failed to make extension for %@ in plug-in at %@: %{public}s";
constexpr std::string_view kLogServiceExtensionFailed =
    "failed to make service extension for %@ in plug-in at %@: %{public}s";

const Value* valueIn(const Dictionary* dictionary, std::string_view key) {
  if (dictionary == nullptr) return nullptr;
  auto it = dictionary->find(key);
  return it == dictionary->end() ? nullptr : &it->second;
}

const Dictionary* dictionaryIn(const Dictionary* dictionary, std::string_view key) {
  const Value* value = valueIn(dictionary, key);
  return value ? value->dictionary() : nullptr;
}

// A value inside what owner holds, sharing ownership of owner.
template <typename Owner, typename T>
std::shared_ptr<const T> sharing(const std::shared_ptr<Owner>& owner, const T* inside) {
  if (inside == nullptr) return nullptr;
  return std::shared_ptr<const T>(owner, inside);
}

ValueRef member(const DictionaryRef& dictionary, std::string_view key) {
  return sharing(dictionary, valueIn(dictionary.get(), key));
}

std::string logText(const Value* value) {
  if (value == nullptr) return "(null)";
  if (const std::string* text = value->string()) return *text;
  return value->description();
}

// The system's own text for an error: strerror for operating-system errors.
std::string systemErrorText(const EkError& error) {
  if (error.domain == kPosixErrorDomain) return std::generic_category().message(error.code);
  return error.message;
}

EkError invalidDefinition(std::string_view message) {
  return EkError::ekora(pk::kCodeInvalidDefinition, std::string(message));
}

// Whole seconds since 1970, the fraction dropped; dates beyond the 32-bit range stick to its
// ends rather than wrap.
int32_t secondsSince1970(const Date& date) {
  const double seconds = std::trunc(date.seconds);
  if (std::isnan(seconds)) return 0;
  if (seconds <= static_cast<double>(std::numeric_limits<int32_t>::min())) {
    return std::numeric_limits<int32_t>::min();
  }
  if (seconds >= static_cast<double>(std::numeric_limits<int32_t>::max())) {
    return std::numeric_limits<int32_t>::max();
  }
  return static_cast<int32_t>(seconds);
}

std::optional<EkFileURL> urlOfPath(const std::optional<std::string>& path) {
  if (!path || path->empty()) return std::nullopt;
  Result<EkFileURL> url = EkFileURL::fromPath(*path);
  if (!url) return std::nullopt;
  return std::move(url).value();
}

// Path lies strictly below root, judged on the text alone: a path with "." or ".."
// components is never below anything.
bool isBelow(std::string_view path, std::string_view root) {
  while (root.size() > 1 && root.ends_with('/')) root.remove_suffix(1);
  if (root == "/") root = "";
  if (!path.starts_with(root) || path.size() <= root.size() + 1 || path[root.size()] != '/') {
    return false;
  }
  std::string_view rest = path.substr(root.size() + 1);
  while (!rest.empty()) {
    const size_t slash = rest.find('/');
    const std::string_view component = rest.substr(0, slash);
    if (component == "." || component == "..") return false;
    if (slash == std::string_view::npos) break;
    rest.remove_prefix(slash + 1);
  }
  return true;
}

}  // namespace

// ---- Construction ---------------------------------------------------------------------------

EkDPlugIn::EkDPlugIn(EkDPlugInContext context) : context_(std::move(context)) {
  if (!context_.registry) throw std::logic_error("EkDPlugIn needs a registry");
}

std::shared_ptr<EkDPlugIn> EkDPlugIn::createWithVRData(const vantor::PlugInProxy& proxy,
                                                       EkDPlugInContext context) {
  std::shared_ptr<EkDPlugIn> record(new EkDPlugIn(std::move(context)));
  if (!record->initWithVRData(proxy)) return nullptr;
  return record;
}

bool EkDPlugIn::initWithVRData(const vantor::PlugInProxy& proxy) {
  std::optional<EkFileURL> url;
  if (!proxy.url.empty()) {
    Result<EkFileURL> parsed = EkFileURL::parse(proxy.url);
    if (parsed) url = std::move(parsed).value();
  }
  if (!url) url = urlOfPath(proxy.path);
  if (!url) return false;

  std::optional<std::string> identifier;
  if (!proxy.identifier.empty()) identifier = proxy.identifier;
  // One copy of the info dictionary: the plug-in dictionary is its "ZuExtension", shared.
  auto info = std::make_shared<const Dictionary>(proxy.info);
  if (!initWithName(std::move(identifier), url, nullptr, nullptr, proxy.uuid)) return false;
  if (DictionaryRef plugIn = sharing(info, dictionaryIn(info.get(), pk::kInfoPlugInDictionary))) {
    setPlugInDictionary(std::move(plugIn));
  }

  setLastModified(secondsSince1970(proxy.registrationDate));
  setOnSystemVolume(proxy.onSystemVolume);
  setLocalizedName(proxy.localizedName);
  setLocalizedShortName(proxy.localizedShortName);
  setLocalizedContainingName(proxy.containingAppName);
  setLocalizedFileProviderActionNames(
      std::make_shared<const Dictionary>(localizedFileProviderActionNamesForEkDict(
          proxy, proxy.extensionDictionary(), *context_.registry)));
  setOriginalIdentifier(proxy.originalIdentifier);
  setEntitlements(std::make_shared<const Dictionary>(proxy.entitlements));
  setDataContainerURL(urlOfPath(proxy.dataContainerPath));
  {
    // Current until the registry's knowledge changes, when the proxy says when it was read.
    CurrentInfoRef current = makeCurrentInfo(std::move(info), &proxy);
    std::lock_guard lock(infoMutex_);
    current_ = std::move(current);
    vrKnowledgeUUID_ = proxy.knowledge;
  }

  std::optional<uint32_t> hubProtocolVersion;
  if (DictionaryRef plugIn = plugInDictionary()) {
    auto it = plugIn->find(pk::kHubProtocolVersion);
    if (it != plugIn->end()) {
      const uint64_t* number = it->second.unsignedNumber();
      if (number != nullptr && *number <= std::numeric_limits<uint32_t>::max()) {
        hubProtocolVersion = static_cast<uint32_t>(*number);
      }
    }
  }
  if (!hubProtocolVersion) {
    hubProtocolVersion = proxy.info.contains(pk::kInfoOldStyleMarker) ? 1 : 2;
  }
  setHubProtocolVersion(*hubProtocolVersion);

  setContainingUrl(urlOfPath(proxy.containingAppPath));

  if (std::optional<EkError> error = diagnose()) {
    log::ops().info(kLogMisconfigured, url->path(), error->description());
    return false;
  }
  return true;
}

// ---- Registry --------------------------------------------------------------------------------

vantor::PlugInProxyPtr EkDPlugIn::getProxy() const {
  const Uuid id = uuid();
  if (vantor::PlugInProxyPtr proxy = context_.registry->plugInByUuid(id)) return proxy;
  std::optional<EkFileURL> location = url();
  log::vr().defaultLevel(kLogProxyFallback, id, location ? location->string() : "(null)");
  if (!location) return nullptr;
  return context_.registry->plugInByUrl(location->string());
}

const Value* EkDPlugIn::CurrentInfo::plugInValue(std::string_view key) const {
  return valueIn(plugIn, key);
}

const Value* EkDPlugIn::CurrentInfo::attribute(std::string_view key) const {
  return valueIn(attributes, key);
}

EkDPlugIn::CurrentInfoRef EkDPlugIn::makeCurrentInfo(DictionaryRef info,
                                                     const vantor::PlugInProxy* proxy) const {
  auto current = std::make_shared<CurrentInfo>();
  current->appExtension = isAppExtension();
  if (proxy != nullptr && proxy->bundleIdentity) {
    const vantor::BundleIdentity& identity = *proxy->bundleIdentity;
    current->bundle = EkBundleIdentity{identity.device, identity.inode, identity.canonicalPath};
  }
  if (info) {
    current->plugIn = dictionaryIn(info.get(), pk::kInfoPlugInDictionary);
    current->attributes = dictionaryIn(current->plugIn, pk::kAttributes);
    current->dedicated = isDedicatedValue(current->plugInValue(pk::kDedicated));
    current->data = isDataProtocol(current->plugInValue(pk::kProtocol));
    current->version = current->attribute(pk::kVersion);
    current->bundleIdentifier = valueIn(info.get(), pk::kInfoBundleIdentifier);
    current->shared = current->plugInValue(pk::kShared);
    current->hostEntitlement = current->plugInValue(pk::kHostEntitlement);
  }
  current->info = std::move(info);
  return current;
}

EkDPlugIn::CurrentInfoRef EkDPlugIn::currentInfo() const {
  const Uuid knowledge = context_.registry->knowledgeUuid();
  {
    std::lock_guard lock(infoMutex_);
    if (vrKnowledgeUUID_ == knowledge) return current_;
  }
  std::lock_guard refresh(refreshMutex_);
  vantor::PlugInProxyPtr proxy = getProxy();
  DictionaryRef info;
  if (proxy) {
    info = std::make_shared<const Dictionary>(proxy->info);
  } else {
    log::ops().error(kLogNoFreshProxy, uuid());
  }
  CurrentInfoRef current = makeCurrentInfo(std::move(info), proxy.get());
  std::lock_guard lock(infoMutex_);
  current_ = std::move(current);
  vrKnowledgeUUID_ = knowledge;
  return current_;
}

DictionaryRef EkDPlugIn::bundleInfoDictionary() const {
  return currentInfo()->info;
}

DictionaryRef EkDPlugIn::infoDmap() const {
  std::lock_guard lock(infoMutex_);
  return current_ ? current_->info : nullptr;
}

EkDPlugIn::AnnotationNote EkDPlugIn::annotationNote() const {
  std::lock_guard lock(infoMutex_);
  return annotationNote_;
}

void EkDPlugIn::setAnnotationNote(AnnotationNote note) const {
  std::lock_guard lock(infoMutex_);
  annotationNote_ = std::move(note);
}

std::optional<Uuid> EkDPlugIn::vrKnowledgeUUID() const {
  std::lock_guard lock(infoMutex_);
  return vrKnowledgeUUID_;
}

const Value* EkDPlugIn::infoValue(const CurrentInfo& current, std::string_view key) const {
  const Value* value = valueIn(current.info.get(), key);
  if (log::vr().enabled(log::Level::Debug)) {
    log::vr().debug(pk::kLogInfoKey, "infoKey", key, logText(value));
  }
  return value;
}

ValueRef EkDPlugIn::infoKey(std::string_view key) const {
  CurrentInfoRef current = currentInfo();
  return sharing(current, infoValue(*current, key));
}

ValueRef EkDPlugIn::pluginKey(std::string_view key) const {
  CurrentInfoRef current = currentInfo();
  return sharing(current, current->plugInValue(key));
}

ValueRef EkDPlugIn::attribute(std::string_view key) const {
  CurrentInfoRef current = currentInfo();
  return sharing(current, current->attribute(key));
}

std::optional<Dictionary> EkDPlugIn::readSDKDictionary(std::string_view extensionPoint) const {
  std::optional<Dictionary> sdk = context_.registry->extensionPointSdk(extensionPoint);
  if (!sdk) log::ops().defaultLevel(pk::kLogSdkNotRegistered, extensionPoint);
  return sdk;
}

// ---- Entitlements ----------------------------------------------------------------------------

ValueRef EkDPlugIn::valueForEntitlement(std::string_view key) const {
  return member(entitlements(), key);
}

bool EkDPlugIn::hasEntitlement(std::string_view key) const {
  ValueRef value = valueForEntitlement(key);
  return entitlementHeld(value.get());
}

std::string EkDPlugIn::annotationKey() const {
  ValueRef replaced = valueForEntitlement(protocol::kEntitlementReplacePlugIn);
  if (replaced && replaced->string() != nullptr) return *replaced->string();
  return identifier().value_or(std::string());
}

std::optional<int64_t> EkDPlugIn::electionNumber(const Value& value) {
  if (const uint64_t* number = value.unsignedNumber()) return static_cast<int64_t>(*number);
  if (const int64_t* number = value.negativeNumber()) return *number;
  if (const double* number = value.doubleNumber()) {
    if (std::isnan(*number)) return 0;
    // 2^63 is exactly representable; everything from there up saturates.
    if (*number >= 9223372036854775808.0) return std::numeric_limits<int64_t>::max();
    if (*number <= -9223372036854775808.0) return std::numeric_limits<int64_t>::min();
    return static_cast<int64_t>(*number);
  }
  if (const bool* flag = value.boolean()) return *flag ? 1 : 0;
  return std::nullopt;
}

// ---- Validation ------------------------------------------------------------------------------

std::optional<EkError> EkDPlugIn::diagnose() const {
  if (std::optional<EkError> error = EkPlugInCore::diagnose()) return error;
  if (!isData() && !dataContainerURL()) return invalidDefinition(kNoDataContainerMessage);
  if (!containingUrl()) {
    const std::string root =
        context_.systemRoot.empty() ? paths::systemRoot() : context_.systemRoot;
    std::optional<std::string> location = path();
    if (!location || !isBelow(*location, root)) return invalidDefinition(kOutsideSystemMessage);
  }
  return std::nullopt;
}

// ---- Sandbox extensions ----------------------------------------------------------------------

EkSandbox& EkDPlugIn::sandbox() const {
  return context_.sandbox ? *context_.sandbox : *EkSandbox::system();
}

void EkDPlugIn::augmentForm(Dictionary& form) const {
  augmentForm(form, *currentInfo());
}

void EkDPlugIn::augmentForm(Dictionary& form, const CurrentInfo& current) const {
  static const Value kWholeBundle(Array{Value(kBundleItself)});
  // An application extension's host reads the whole bundle, nothing beside it.
  const Value* shared = current.appExtension ? &kWholeBundle : current.shared;
  if (shared) {
    if (std::optional<Dictionary> extensions = issueResourceExtensions(*shared, current)) {
      form.insert_or_assign(std::string(pk::form::kExtensions), std::move(*extensions));
    }
  }

  if (current.data) return;
  if (log::vr().enabled(log::Level::Debug)) {
    log::vr().debug(pk::kLogInfoKey, "infoKey", pk::kInfoBundleIdentifier,
                    logText(current.bundleIdentifier));
  }
  const std::string* service =
      current.bundleIdentifier ? current.bundleIdentifier->string() : nullptr;
  Result<std::string> token =
      serviceExtension(service ? std::string_view(*service) : std::string_view(), current);
  if (token) {
    form.insert_or_assign(std::string(pk::form::kServiceExtension), std::move(token).value());
  } else {
    log::ops().info(kLogServiceExtensionFailed, logText(current.bundleIdentifier),
                    path().value_or("(null)"), systemErrorText(token.error()));
  }
}

std::optional<Dictionary> EkDPlugIn::issueResourceExtensions(const Value& paths) const {
  return issueResourceExtensions(paths, *currentInfo());
}

std::optional<Dictionary> EkDPlugIn::issueResourceExtensions(const Value& paths,
                                                             const CurrentInfo& current) const {
  Array single;
  const Array* elements = paths.array();
  if (elements == nullptr) {
    if (paths.string() == nullptr) return std::nullopt;
    single.push_back(paths);
    elements = &single;
  }

  Dictionary result;
  const std::optional<EkFileURL> bundle = url();
  if (!bundle) return result;
  const std::string& bundlePath = bundle->path();
  for (const Value& element : *elements) {
    const std::string* relative = element.string();
    if (relative == nullptr) continue;
    // Every target must resolve inside the bundle as registered: "Shared" is the plug-in's to
    // write, and a "../..", an absolute path or a link out of the bundle, or a bundle
    // directory swapped for a link, must not hand a host the rest of the disk.
    const bool itself = *relative == kBundleItself;
    Result<std::string> token =
        itself ? bundleItselfExtension(bundlePath, current)
               : ek::issueBundleExtension(bundlePath, current.bundle, *relative, sandbox());
    if (!token) {
      const std::string targetPath = itself ? bundlePath : paths::join(bundlePath, *relative);
      log::ops().info(kLogResourceExtensionFailed, targetPath, bundlePath,
                      systemErrorText(token.error()));
      continue;
    }
    result.insert_or_assign(*relative, std::move(token).value());
  }
  return result;
}

Result<std::string> EkDPlugIn::bundleItselfExtension(const std::string& bundlePath,
                                                     const CurrentInfo& current) const {
  // Checked on every use: the token names a path, and is given out only while the directory
  // there is the one registered.
  if (Result<void> checked = checkRegisteredBundle(bundlePath, current.bundle); !checked) {
    return std::move(checked).error();
  }
  std::lock_guard lock(current.tokens->mutex);
  if (current.tokens->bundle.empty()) {
    Result<std::string> token = ek::issueBundleExtension(bundlePath, current.bundle, {}, sandbox());
    if (!token) return token;
    current.tokens->bundle = std::move(token).value();
  }
  return current.tokens->bundle;
}

Result<std::string> EkDPlugIn::serviceExtension(std::string_view service,
                                                const CurrentInfo& current) const {
  std::lock_guard lock(current.tokens->mutex);
  if (current.tokens->service.empty()) {
    Result<std::string> token = issueServiceExtension(service, sandbox());
    if (!token) return token;
    current.tokens->service = std::move(token).value();
  }
  return current.tokens->service;
}

Result<std::string> EkDPlugIn::issueBundleExtension() const {
  const std::optional<EkFileURL> bundle = url();
  if (!bundle) return EkError::posix(ENOENT, "no bundle URL");
  return ek::issueBundleExtension(bundle->path(), currentInfo()->bundle, {}, sandbox());
}

// ---- Localized file-provider action names --------------------------------------------------

Dictionary localizedFileProviderActionNamesForEkDict(const vantor::PlugInProxy& proxy,
                                                     const Dictionary* extensionDictionary,
                                                     vantor::Registry& registry) {
  Dictionary result;
  if (extensionDictionary == nullptr) return result;
  auto it = extensionDictionary->find(kFileProviderActions);
  if (it == extensionDictionary->end() || it->second.array() == nullptr) return result;

  std::set<std::string> names;
  for (const Value& action : *it->second.array()) {
    const std::string* name = action.getString(kFileProviderActionName);
    if (name == nullptr) {
      log::vr().error(kLogMissingActionName, proxy);
      continue;
    }
    names.insert(*name);
  }
  if (names.empty()) return result;

  const std::vector<std::string> keys(names.begin(), names.end());
  const Dictionary localized = registry.localizedStrings(proxy.uuid, kLocalizableTable, keys);
  for (const std::string& name : keys) {
    auto entry = localized.find(name);
    if (entry != localized.end() && entry->second.string() != nullptr) {
      result.insert_or_assign(name, *entry->second.string());
    } else {
      result.insert_or_assign(name, name);
    }
  }
  return result;
}

}  // namespace ek
