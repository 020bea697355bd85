#include "Ekora/EkPlugInCore.h"

#include <fmt/format.h>
#include <fmt/ranges.h>

#include <limits>
#include <set>
#include <stdexcept>

#include "Ekora/EkCollections.h"
#include "Ekora/EkPlugInKeys.h"
#include "platform/log/Log.h"
#include "platform/vantor/SdkMerge.h"

namespace ek {

namespace pk = plugin;

namespace {

// The member under key, sharing ownership of the whole dictionary.
ValueRef member(const DictionaryRef& dictionary, std::string_view key) {
  if (!dictionary) return nullptr;
  auto it = dictionary->find(key);
  if (it == dictionary->end()) return nullptr;
  return ValueRef(dictionary, &it->second);
}

const Value* find(const Dictionary& dictionary, std::string_view key) {
  auto it = dictionary.find(key);
  return it == dictionary.end() ? nullptr : &it->second;
}

void put(Dictionary& dictionary, std::string_view key, Value value) {
  dictionary.insert_or_assign(std::string(key), std::move(value));
}

// How a value appears in a log line: strings as they are, absence as "(null)".
std::string logText(const Value* value) {
  if (value == nullptr) return "(null)";
  if (const std::string* text = value->string()) return *text;
  return value->description();
}

std::string logText(const std::optional<std::string>& text) {
  return text ? *text : "(null)";
}

template <typename... Args>
std::string formatText(std::string_view format, const Args&... args) {
  const log::Arg list[] = {log::Arg(args)...};
  return log::formatMessage(format, list);
}

EkError invalidDefinition(std::string message) {
  return EkError::ekora(pk::kCodeInvalidDefinition, std::move(message));
}

const ValueRef& defaultSpec() {
  static const ValueRef spec = std::make_shared<const Value>(pk::kDefaultSpec);
  return spec;
}

bool isString(const ValueRef& value, std::string_view text) {
  if (!value) return false;
  const std::string* string = value->string();
  return string != nullptr && *string == text;
}

EkError malformedForm(std::string_view what) {
  return EkError::format(fmt::format("plug-in form: {}", what));
}

// Typed optional members of a form: absent is fine, another type is not.
class FormReader {
 public:
  explicit FormReader(const Dictionary& form) : form_(form) {}

  const Value* get(std::string_view key) const { return find(form_, key); }

  Result<std::optional<std::string>> string(std::string_view key) const {
    const Value* value = get(key);
    if (value == nullptr) return std::optional<std::string>();
    if (const std::string* text = value->string()) return std::optional<std::string>(*text);
    return wrongType(key, "a string");
  }
  Result<DictionaryRef> dictionary(std::string_view key) const {
    const Value* value = get(key);
    if (value == nullptr) return DictionaryRef();
    if (const Dictionary* dictionary = value->dictionary()) {
      return DictionaryRef(std::make_shared<const Dictionary>(*dictionary));
    }
    return wrongType(key, "a dictionary");
  }
  Result<std::optional<EkFileURL>> fileURL(std::string_view key) const {
    std::optional<std::string> path = EK_TRY(string(key));
    if (!path) return std::optional<EkFileURL>();
    Result<EkFileURL> url = EkFileURL::fromPath(*path);
    if (!url) return malformedForm(fmt::format("\"{}\": {}", key, url.error().message));
    return std::optional<EkFileURL>(std::move(url).value());
  }
  template <typename Integer>
  Result<std::optional<Integer>> integer(std::string_view key) const {
    const Value* value = get(key);
    if (value == nullptr) return std::optional<Integer>();
    if (const uint64_t* number = value->unsignedNumber()) {
      if (*number <= static_cast<uint64_t>(std::numeric_limits<Integer>::max())) {
        return std::optional<Integer>(static_cast<Integer>(*number));
      }
    } else if (const int64_t* negative = value->negativeNumber()) {
      if constexpr (std::is_signed_v<Integer>) {
        if (*negative >= std::numeric_limits<Integer>::min()) {
          return std::optional<Integer>(static_cast<Integer>(*negative));
        }
      }
    }
    return wrongType(key, "an integer in range");
  }

 private:
  static EkError wrongType(std::string_view key, std::string_view expected) {
    return malformedForm(fmt::format("\"{}\" is not {}", key, expected));
  }

  const Dictionary& form_;
};

}  // namespace

// ---- Construction ---------------------------------------------------------------------------

std::shared_ptr<EkPlugInCore> EkPlugInCore::createWithName(std::optional<std::string> identifier,
                                                           std::optional<EkFileURL> url,
                                                           const Value* bundleInfo,
                                                           const Dictionary* info,
                                                           std::optional<Uuid> uuid) {
  std::shared_ptr<EkPlugInCore> record(new EkPlugInCore());
  if (!record->initWithName(std::move(identifier), std::move(url), bundleInfo, info, uuid)) {
    return nullptr;
  }
  return record;
}

bool EkPlugInCore::initWithName(std::optional<std::string> identifier, std::optional<EkFileURL> url,
                                const Value* bundleInfo, const Dictionary* info,
                                std::optional<Uuid> uuid) {
  if (!setupWithName(std::move(identifier), std::move(url), bundleInfo, uuid)) return false;
  if (!plugInDictionary() && info != nullptr) {
    setPlugInDictionary(std::make_shared<const Dictionary>(*info));
  }
  return true;
}

bool EkPlugInCore::setupWithName(std::optional<std::string> identifier,
                                 std::optional<EkFileURL> url, const Value* bundleInfo,
                                 std::optional<Uuid> uuid) {
  if (!url) return false;
  if (!identifier) {
    log::ops().error(pk::kLogMissingIdentifier, url->path());
    return false;
  }
  if (bundleInfo != nullptr) {
    Value normalized = normalizeInfoDictionary(*bundleInfo);
    if (!setDictionaries(normalized)) {
      log::ops().defaultLevel(pk::kLogMalformedDictionary, *identifier, url->string(), normalized);
      return false;
    }
    log::vr().debug(pk::kLogOperationName, "setupWithName",
                    logText(normalized.get(pk::kInfoDisplayName)));
  }
  std::lock_guard lock(mutex_);
  identifier_ = std::move(identifier);
  url_ = std::move(url);
  uuid_ = uuid ? *uuid : Uuid::random();
  return true;
}

bool EkPlugInCore::setDictionaries(Value bundleInfo) {
  Dictionary* dictionary = bundleInfo.dictionary();
  if (dictionary == nullptr) return false;
  auto stored = std::make_shared<const Dictionary>(std::move(*dictionary));
  {
    std::lock_guard lock(mutex_);
    bundleInfoDictionary_ = stored;
  }
  log::ops().debug(pk::kLogOperationName, "setDictionaries",
                   logText(find(*stored, pk::kInfoDisplayName)));

  const Value* plugIn = find(*stored, pk::kInfoPlugInDictionary);
  if (plugIn == nullptr || plugIn->dictionary() == nullptr) return false;
  DictionaryRef plugInDictionary(stored, plugIn->dictionary());
  {
    std::lock_guard lock(mutex_);
    plugInDictionary_ = plugInDictionary;
  }
  if (find(*plugInDictionary, pk::kMultiple) != nullptr) {
    log::ops().defaultLevel(pk::kLogMultipleObsolete, pk::kMultiple);
  }
  return true;
}

Result<std::shared_ptr<EkPlugInCore>> EkPlugInCore::createWithForm(const Dictionary& form) {
  namespace f = pk::form;
  FormReader reader(form);

  std::optional<std::string> identifier = EK_TRY(reader.string(f::kIdentifier));
  if (!identifier) return malformedForm("no \"identifier\"");
  std::optional<EkFileURL> url = EK_TRY(reader.fileURL(f::kPath));
  if (!url) return malformedForm("no \"path\"");
  const Value* bundleInfo = reader.get(f::kBundleInfo);
  DictionaryRef info = EK_TRY(reader.dictionary(f::kInfo));
  std::optional<Uuid> uuid;
  if (const Value* uuidValue = reader.get(f::kUuid)) {
    if (const std::string* text = uuidValue->string()) {
      uuid = Uuid::parse(*text);
    } else if (const Uuid* binary = uuidValue->uuid()) {
      uuid = *binary;
    }
  }

  std::shared_ptr<EkPlugInCore> record(new EkPlugInCore());
  if (!record->initWithName(std::move(identifier), std::move(url), bundleInfo, info.get(), uuid)) {
    return malformedForm("\"bundleInfo\" is not an info dictionary with a plug-in dictionary");
  }
  // The form's "info" is the plug-in dictionary the sender exported, which canonicalisation
  // may have made differ from the bundle info's own "ZuExtension".
  if (info) record->setPlugInDictionary(info);

  std::optional<uint32_t> hubProtocolVersion =
      EK_TRY(reader.integer<uint32_t>(f::kHubProtocolVersion));
  record->setHubProtocolVersion(hubProtocolVersion.value_or(1));
  record->setOriginalIdentifier(EK_TRY(reader.string(f::kOriginalIdentifier)));
  if (const Value* hash = reader.get(f::kHash)) {
    if (hash->data() == nullptr) return malformedForm("\"hash\" is not data");
    record->setCdhash(*hash->data());
  }
  record->setRequirement(EK_TRY(reader.string(f::kRequirement)));
  std::optional<int32_t> lastModified = EK_TRY(reader.integer<int32_t>(f::kLastModified));
  record->setLastModified(lastModified.value_or(0));
  record->setEntitlements(EK_TRY(reader.dictionary(f::kEntitlements)));
  record->setContainingUrl(EK_TRY(reader.fileURL(f::kContainingPath)));
  if (const Value* resident = reader.get(f::kSystemResident)) {
    if (resident->boolean() == nullptr) return malformedForm("\"systemResident\" is not boolean");
    record->setOnSystemVolume(*resident->boolean());
  }
  record->setAnnotations(EK_TRY(reader.dictionary(f::kAnnotations)));
  record->setLocalizedName(EK_TRY(reader.string(f::kLocalizedDisplayName)));
  record->setLocalizedShortName(EK_TRY(reader.string(f::kLocalizedShortName)));
  record->setLocalizedContainingName(EK_TRY(reader.string(f::kLocalizedContainingDisplayName)));
  record->setLocalizedFileProviderActionNames(
      EK_TRY(reader.dictionary(f::kLocalizedFileProviderActionNames)));
  return record;
}

// ---- Stored properties ----------------------------------------------------------------------

bool EkPlugInCore::onSystemVolume() const {
  return read(onSystemVolume_);
}
void EkPlugInCore::setOnSystemVolume(bool value) {
  write(onSystemVolume_, value);
}
DictionaryRef EkPlugInCore::plugInDictionary() const {
  return read(plugInDictionary_);
}
void EkPlugInCore::setPlugInDictionary(DictionaryRef value) {
  write(plugInDictionary_, std::move(value));
}
std::optional<std::string> EkPlugInCore::identifier() const {
  return read(identifier_);
}
void EkPlugInCore::setIdentifier(std::optional<std::string> value) {
  write(identifier_, std::move(value));
}
std::optional<std::string> EkPlugInCore::originalIdentifier() const {
  return read(originalIdentifier_);
}
void EkPlugInCore::setOriginalIdentifier(std::optional<std::string> value) {
  write(originalIdentifier_, std::move(value));
}
std::optional<EkFileURL> EkPlugInCore::url() const {
  return read(url_);
}
void EkPlugInCore::setUrl(std::optional<EkFileURL> value) {
  write(url_, std::move(value));
}
std::optional<EkFileURL> EkPlugInCore::containingUrl() const {
  return read(containingUrl_);
}
void EkPlugInCore::setContainingUrl(std::optional<EkFileURL> value) {
  write(containingUrl_, std::move(value));
}
DictionaryRef EkPlugInCore::bundleInfoDictionary() const {
  return read(bundleInfoDictionary_);
}
DictionaryRef EkPlugInCore::storedBundleInfoDictionary() const {
  return read(bundleInfoDictionary_);
}
void EkPlugInCore::setBundleInfoDictionary(DictionaryRef value) {
  write(bundleInfoDictionary_, std::move(value));
}
DictionaryRef EkPlugInCore::entitlements() const {
  return read(entitlements_);
}
void EkPlugInCore::setEntitlements(DictionaryRef value) {
  write(entitlements_, std::move(value));
}
uint32_t EkPlugInCore::hubProtocolVersion() const {
  return read(hubProtocolVersion_);
}
void EkPlugInCore::setHubProtocolVersion(uint32_t value) {
  write(hubProtocolVersion_, value);
}
std::optional<std::string> EkPlugInCore::localizedName() const {
  return read(localizedName_);
}
void EkPlugInCore::setLocalizedName(std::optional<std::string> value) {
  write(localizedName_, std::move(value));
}
std::optional<std::string> EkPlugInCore::localizedShortName() const {
  return read(localizedShortName_);
}
void EkPlugInCore::setLocalizedShortName(std::optional<std::string> value) {
  write(localizedShortName_, std::move(value));
}
std::optional<std::string> EkPlugInCore::localizedContainingName() const {
  return read(localizedContainingName_);
}
void EkPlugInCore::setLocalizedContainingName(std::optional<std::string> value) {
  write(localizedContainingName_, std::move(value));
}
DictionaryRef EkPlugInCore::localizedFileProviderActionNames() const {
  return read(localizedFileProviderActionNames_);
}
void EkPlugInCore::setLocalizedFileProviderActionNames(DictionaryRef value) {
  write(localizedFileProviderActionNames_, std::move(value));
}
DictionaryRef EkPlugInCore::annotations() const {
  return read(annotations_);
}
void EkPlugInCore::setAnnotations(DictionaryRef value) {
  write(annotations_, std::move(value));
}
int32_t EkPlugInCore::lastModified() const {
  return read(lastModified_);
}
void EkPlugInCore::setLastModified(int32_t value) {
  write(lastModified_, value);
}
Uuid EkPlugInCore::uuid() const {
  std::optional<Uuid> uuid = read(uuid_);
  if (!uuid) throw std::logic_error(std::string(pk::kMissingUuidCondition));
  return *uuid;
}
void EkPlugInCore::setUuid(Uuid value) {
  write(uuid_, std::optional<Uuid>(value));
}
std::optional<Data> EkPlugInCore::cdhash() const {
  return read(cdhash_);
}
void EkPlugInCore::setCdhash(std::optional<Data> value) {
  write(cdhash_, std::move(value));
}
std::optional<std::string> EkPlugInCore::requirement() const {
  return read(requirement_);
}
void EkPlugInCore::setRequirement(std::optional<std::string> value) {
  write(requirement_, std::move(value));
}

// ---- Derived properties ---------------------------------------------------------------------

std::optional<std::string> EkPlugInCore::path() const {
  std::optional<EkFileURL> location = url();
  if (!location) return std::nullopt;
  return location->path();
}

std::optional<std::string> EkPlugInCore::containingPath() const {
  std::optional<EkFileURL> location = containingUrl();
  if (!location) return std::nullopt;
  return location->path();
}

DictionaryRef EkPlugInCore::attributes() const {
  ValueRef value = pluginKey(pk::kAttributes);
  if (!value || value->dictionary() == nullptr) return nullptr;
  return DictionaryRef(value, value->dictionary());
}

ValueRef EkPlugInCore::version() const {
  return attribute(pk::kVersion);
}

std::optional<std::string> EkPlugInCore::versionString() const {
  ValueRef value = version();
  if (!value || value->string() == nullptr) return std::nullopt;
  return *value->string();
}

ValueRef EkPlugInCore::protocolSpec() const {
  ValueRef value = pluginKey(pk::kProtocol);
  if (!value && isAppExtension()) return defaultSpec();
  return value;
}

ValueRef EkPlugInCore::principalSpec() const {
  ValueRef value = pluginKey(pk::kPrincipalClass);
  if (!value && isAppExtension()) return defaultSpec();
  return value;
}

ValueRef EkPlugInCore::sdkSpec() const {
  return pluginKey(pk::kExtensionPointIdentifier);
}

bool EkPlugInCore::isAppExtension() const {
  std::optional<std::string> location = path();
  return location && location->ends_with(pk::kAppExtensionSuffix);
}

bool EkPlugInCore::isHybrid() const {
  return pluginKey(pk::kEmbeddedCode) != nullptr;
}

bool EkPlugInCore::isDedicated() const {
  return isDedicatedValue(pluginKey(pk::kDedicated).get());
}

bool EkPlugInCore::isData() const {
  // The default protocol of an application extension is not "#Data": the declared one decides.
  return isDataProtocol(pluginKey(pk::kProtocol).get());
}

bool EkPlugInCore::isDedicatedValue(const Value* value) {
  if (value == nullptr) return false;
  if (const bool* flag = value->boolean()) return *flag;
  if (std::optional<double> number = value->numericValue()) return *number != 0;
  return false;
}

bool EkPlugInCore::isDataProtocol(const Value* protocol) {
  const std::string* text = protocol ? protocol->string() : nullptr;
  return text != nullptr && *text == pk::kDataProtocol;
}

// ---- Lookups --------------------------------------------------------------------------------

ValueRef EkPlugInCore::infoKey(std::string_view key) const {
  ValueRef value = member(bundleInfoDictionary(), key);
  if (log::vr().enabled(log::Level::Debug)) {
    log::vr().debug(pk::kLogInfoKey, "infoKey", key, logText(value.get()));
  }
  return value;
}

ValueRef EkPlugInCore::pluginKey(std::string_view key) const {
  return member(plugInDictionary(), key);
}

ValueRef EkPlugInCore::attribute(std::string_view key) const {
  return member(attributes(), key);
}

// ---- Form and annotations -------------------------------------------------------------------

EkPlugInCore::FormExport EkPlugInCore::exportForm() const {
  namespace f = pk::form;
  FormExport result;
  Dictionary& form = result.form;
  std::vector<std::string_view> missing;

  std::optional<Dictionary> bundleInfo;
  if (DictionaryRef info = bundleInfoDictionary()) {
    bundleInfo = *info;
    bundleInfo->erase(std::string(pk::kInfoDmapURL));
  }
  std::optional<std::string> identifier = this->identifier();
  std::optional<std::string> localizedName = this->localizedName();
  // A form without bundle info stays without: a bundle info holding only a name would not
  // read back.
  if (localizedName && bundleInfo) {
    log::vr().debug(pk::kLogDisplayNameWas, "exportForm",
                    logText(find(*bundleInfo, pk::kInfoDisplayName)));
    put(*bundleInfo, pk::kInfoDisplayName, *localizedName);
    log::vr().debug(pk::kLogDisplayNameIs, "exportForm", *localizedName);
  }

  put(form, f::kHubProtocolVersion, hubProtocolVersion());
  if (std::optional<std::string> location = path()) {
    put(form, f::kPath, std::move(*location));
  } else {
    missing.push_back(f::kPath);
  }
  put(form, f::kSystemResident, onSystemVolume());
  if (identifier) {
    put(form, f::kIdentifier, *identifier);
  } else {
    missing.push_back(f::kIdentifier);
  }
  if (std::optional<std::string> original = originalIdentifier()) {
    put(form, f::kOriginalIdentifier, std::move(*original));
  } else {
    missing.push_back(f::kOriginalIdentifier);
  }
  ValueRef version = this->version();
  put(form, f::kVersion, version ? *version : Value(pk::kNoVersion));
  if (bundleInfo) {
    put(form, f::kBundleInfo, std::move(*bundleInfo));
  } else {
    missing.push_back(f::kBundleInfo);
  }
  if (DictionaryRef plugIn = plugInDictionary()) {
    put(form, f::kInfo, *plugIn);
  } else {
    missing.push_back(f::kInfo);
  }
  put(form, f::kUuid, uuid().string());
  put(form, f::kLastModified, lastModified());
  DictionaryRef annotations = this->annotations();
  put(form, f::kAnnotations, annotations ? *annotations : Dictionary{});

  if (DictionaryRef entitlements = this->entitlements()) {
    put(form, f::kEntitlements, *entitlements);
  }
  if (std::optional<std::string> containing = containingPath()) {
    put(form, f::kContainingPath, std::move(*containing));
  }
  if (std::optional<std::string> name = localizedContainingName()) {
    put(form, f::kLocalizedContainingDisplayName, std::move(*name));
  }
  if (localizedName) put(form, f::kLocalizedDisplayName, *localizedName);
  if (std::optional<std::string> name = localizedShortName()) {
    put(form, f::kLocalizedShortName, std::move(*name));
  }
  if (DictionaryRef names = localizedFileProviderActionNames()) {
    put(form, f::kLocalizedFileProviderActionNames, *names);
  }

  if (!missing.empty()) {
    result.error = EkError::ekora(pk::kCodeNotCarriedOut,
                                  formatText(pk::kIncompleteFormFormat, logText(identifier),
                                             fmt::format("\"{}\"", fmt::join(missing, "\", \""))));
  }
  return result;
}

void EkPlugInCore::updateFromForm(const Dictionary& form) {
  const Value* annotations = find(form, pk::form::kAnnotations);
  if (annotations != nullptr && annotations->dictionary() != nullptr) {
    setAnnotations(std::make_shared<const Dictionary>(*annotations->dictionary()));
  } else {
    setAnnotations(nullptr);
  }
}

void EkPlugInCore::setAnnotation(std::string_view key, std::optional<Value> value) {
  std::lock_guard lock(mutex_);
  std::optional<Dictionary> changed = dictionaryChanging(annotations_.get(), key, std::move(value));
  if (changed) annotations_ = std::make_shared<const Dictionary>(std::move(*changed));
}

// ---- Validation and SDK ---------------------------------------------------------------------

std::optional<EkError> EkPlugInCore::diagnose() const {
  if (!identifier()) return invalidDefinition(std::string(pk::kMissingIdentifierMessage));
  if (!protocolSpec()) {
    return invalidDefinition(formatText(pk::kMissingKeyFormat, pk::kProtocol));
  }
  if (!attributes()) {
    return invalidDefinition(formatText(pk::kMissingKeyFormat, pk::kAttributes));
  }
  if (isAppExtension() && !isString(principalSpec(), pk::kDefaultSpec)) {
    return invalidDefinition(formatText(pk::kAppExtensionKeyFormat, pk::kPrincipalClass));
  }
  if (pluginKey(pk::kPassProxy)) {
    return invalidDefinition(formatText(pk::kUnsupportedKeyFormat, pk::kPassProxy));
  }
  if (isHybrid()) return invalidDefinition(std::string(pk::kHybridMessage));
  return std::nullopt;
}

void EkPlugInCore::resolveSDK() {
  DictionaryRef bundleInfo = bundleInfoDictionary();
  if (!bundleInfo) throw std::logic_error(std::string(pk::kResolveWithoutInfoMessage));
  if (ValueRef sdk = sdkSpec()) {
    const std::string* extensionPoint = sdk->string();
    if (extensionPoint == nullptr) {
      log::ops().error(pk::kLogInvalidSdkKey, *sdk);
      return;
    }
    if (std::optional<Dictionary> sdkDictionary = readSDKDictionary(*extensionPoint)) {
      Dictionary merged = mergeDictionary(*sdkDictionary, *bundleInfo);
      std::string displayName = logText(find(merged, pk::kInfoDisplayName));
      setDictionaries(Value(std::move(merged)));
      log::vr().debug(pk::kLogMergedWithSdk, "resolveSDK", displayName);
    }
  }
  canonicalize();
}

std::optional<Dictionary> EkPlugInCore::readSDKDictionary(std::string_view extensionPoint) const {
  log::ops().defaultLevel(pk::kLogSdkNotRegistered, extensionPoint);
  return std::nullopt;
}

Dictionary EkPlugInCore::mergeDictionary(const Dictionary& sdk, const Dictionary& target) {
  return vantor::mergeSdk(sdk, target);
}

bool EkPlugInCore::sdkOverridesKey(std::string_view key) {
  return vantor::sdkOverridesKey(key);
}

Array EkPlugInCore::mergeSharedResources(const Value* sdkList, const Value* plugInList) {
  return vantor::mergeSharedLists(sdkList, plugInList);
}

void EkPlugInCore::canonicalize() {
  DictionaryRef plugIn = plugInDictionary();
  // Nothing to give attributes to.
  if (!plugIn) return;
  DictionaryRef attributes = this->attributes();
  Dictionary canonicalAttributes = attributes ? *attributes : Dictionary{};
  if (!attribute(pk::kVersion)) {
    ValueRef shortVersion = infoKey(pk::kInfoShortVersionString);
    put(canonicalAttributes, pk::kVersion,
        shortVersion ? *shortVersion : Value(pk::kDefaultVersion));
  }
  Dictionary canonical = *plugIn;
  put(canonical, pk::kAttributes, std::move(canonicalAttributes));
  setPlugInDictionary(std::make_shared<const Dictionary>(std::move(canonical)));
}

// ---- Localized values -----------------------------------------------------------------------

Result<Dictionary> EkPlugInCore::localizedInfoDictionaryForKeys(
    const std::vector<std::string>& keys) const {
  DictionaryRef stored = storedBundleInfoDictionary();
  if (!stored) {
    return EkError::ekora(pk::kCodeUnresolved,
                          formatText(pk::kUnresolvedFormat, logText(identifier())));
  }
  Dictionary result;
  for (const std::string& key : keys) {
    std::optional<Value> value;
    std::optional<std::string> localized;
    if (key == pk::kInfoBundleName) {
      localized = localizedShortName();
    } else if (key == pk::kInfoDisplayName) {
      localized = localizedName();
    }
    if (localized) {
      value = Value(std::move(*localized));
    } else if (ValueRef info = infoKey(key)) {
      value = *info;
    } else if (const Value* own = find(*stored, key)) {
      value = *own;
    }
    // Every value of the value model can be archived securely, so none ends the lookup.
    if (value) put(result, key, std::move(*value));
  }
  if (log::vr().enabled(log::Level::Debug)) {
    log::vr().debug(pk::kLogLocalizedValues, Value(result));
  }
  return result;
}

void EkPlugInCore::localizedInfoDictionaryForKeys(
    const std::vector<std::string>& keys,
    const std::function<void(std::optional<Dictionary>, std::optional<EkError>)>& completion)
    const {
  Result<Dictionary> result = localizedInfoDictionaryForKeys(keys);
  if (result) {
    completion(std::move(result).value(), std::nullopt);
  } else {
    completion(std::nullopt, std::move(result).error());
  }
}

std::string EkPlugInCore::description() const {
  std::optional<Uuid> uuid = read(uuid_);
  return fmt::format("{}({}) at {}", logText(identifier()), uuid ? uuid->string() : "(null)",
                     logText(path()));
}

}  // namespace ek
