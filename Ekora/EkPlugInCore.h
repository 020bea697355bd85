#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Ekora/EkFileURL.h"
#include "platform/value/EkError.h"
#include "platform/value/Result.h"
#include "platform/value/Uuid.h"
#include "platform/value/Value.h"

namespace ek {

// Shared references to immutable values: a record hands these out instead of copies, and a
// reference stays valid after the record replaces the value. nullptr is "absent".
using DictionaryRef = std::shared_ptr<const Dictionary>;
using ValueRef = std::shared_ptr<const Value>;

// The record of one plug-in: where its bundle is, its identifier and UUID, its info dictionary
// and the "ZuExtension" (plug-in) dictionary inside it, and what the registry adds. The record
// reads only dictionaries and never opens a file. Records are shared by std::shared_ptr and
// compare by UUID alone.
//
// Every stored property is read and written atomically (one lock per record), so a record may
// be read from any thread once built; setters replace whole values. A constructed record always
// has a url, an identifier and a uuid.
//
// The daemon's record derives from this one and replaces the lookups (bundleInfoDictionary,
// infoKey, pluginKey, attribute), diagnose, the localized names, originalIdentifier and
// entitlements, and readSDKDictionary.
class EkPlugInCore {
 public:
  // What exportForm answers: the form, and an error when some of the base keys could not be
  // written because the record lacks their value (the form then simply leaves them out).
  struct FormExport {
    Dictionary form;
    std::optional<EkError> error;
  };

  virtual ~EkPlugInCore() = default;
  EkPlugInCore(const EkPlugInCore&) = delete;
  EkPlugInCore& operator=(const EkPlugInCore&) = delete;

  // A record from its parts, or nullptr when set-up refuses them (no url, no identifier,
  // bundleInfo that is not a dictionary or whose "ZuExtension" is not one). When the bundle
  // info gives no plug-in dictionary, info becomes it. A missing uuid is replaced by a random
  // one.
  static std::shared_ptr<EkPlugInCore> createWithName(std::optional<std::string> identifier,
                                                      std::optional<EkFileURL> url,
                                                      const Value* bundleInfo,
                                                      const Dictionary* info,
                                                      std::optional<Uuid> uuid);

  // The inverse of exportForm. Refuses, with a Format error, a form that set-up refuses or
  // that holds a key of the wrong type; an absent key leaves its field absent, zero or false
  // (but "hubProtocolVersion" reads as 1). A "uuid" that is not UUID text gives a random UUID.
  // When the form has an "info" dictionary it is the record's plug-in dictionary, so that
  // exportForm of the result gives back the form it was read from.
  static Result<std::shared_ptr<EkPlugInCore>> createWithForm(const Dictionary& form);

  // Set-up steps, also run by createWithName. setupWithName answers false for parts it
  // refuses (see createWithName); info is not used here.
  bool setupWithName(std::optional<std::string> identifier, std::optional<EkFileURL> url,
                     const Value* bundleInfo, std::optional<Uuid> uuid);
  // Stores a bundle info dictionary and its "ZuExtension" dictionary. False when the argument
  // is not a dictionary (nothing stored) or its "ZuExtension" is not one (the bundle info is
  // stored, the plug-in dictionary keeps its old value).
  bool setDictionaries(Value bundleInfo);
  // A hook between reading an info dictionary and storing it; the base passes it through.
  virtual Value normalizeInfoDictionary(Value bundleInfo) const { return bundleInfo; }

  // Identity: the UUID alone.
  bool isEqual(const EkPlugInCore& other) const { return uuid() == other.uuid(); }
  bool operator==(const EkPlugInCore& other) const { return isEqual(other); }
  size_t hash() const { return std::hash<Uuid>{}(uuid()); }

  // Stored properties.
  bool onSystemVolume() const;
  void setOnSystemVolume(bool onSystemVolume);
  DictionaryRef plugInDictionary() const;
  void setPlugInDictionary(DictionaryRef dictionary);
  std::optional<std::string> identifier() const;
  void setIdentifier(std::optional<std::string> identifier);
  virtual std::optional<std::string> originalIdentifier() const;
  void setOriginalIdentifier(std::optional<std::string> originalIdentifier);
  std::optional<EkFileURL> url() const;
  void setUrl(std::optional<EkFileURL> url);
  std::optional<EkFileURL> containingUrl() const;
  void setContainingUrl(std::optional<EkFileURL> url);
  virtual DictionaryRef bundleInfoDictionary() const;
  void setBundleInfoDictionary(DictionaryRef dictionary);
  virtual DictionaryRef entitlements() const;
  void setEntitlements(DictionaryRef entitlements);
  uint32_t hubProtocolVersion() const;
  void setHubProtocolVersion(uint32_t version);
  virtual std::optional<std::string> localizedName() const;
  void setLocalizedName(std::optional<std::string> name);
  virtual std::optional<std::string> localizedShortName() const;
  void setLocalizedShortName(std::optional<std::string> name);
  virtual std::optional<std::string> localizedContainingName() const;
  void setLocalizedContainingName(std::optional<std::string> name);
  // Action name to localized title.
  virtual DictionaryRef localizedFileProviderActionNames() const;
  void setLocalizedFileProviderActionNames(DictionaryRef names);
  DictionaryRef annotations() const;
  void setAnnotations(DictionaryRef annotations);
  // Registration time, whole seconds since 1970 UTC.
  int32_t lastModified() const;
  void setLastModified(int32_t seconds);
  // A constructed record always has one; asking a record that has none is a broken invariant
  // (std::logic_error "self.uuid").
  Uuid uuid() const;
  void setUuid(Uuid uuid);
  std::optional<Data> cdhash() const;
  void setCdhash(std::optional<Data> cdhash);
  std::optional<std::string> requirement() const;
  void setRequirement(std::optional<std::string> requirement);
  // Set once by the daemon's record while it is built; not guarded.
  const std::optional<EkFileURL>& dataContainerURL() const { return dataContainerURL_; }

  // Derived properties, computed on each read.
  std::optional<std::string> path() const;
  std::optional<std::string> containingPath() const;
  // pluginKey("ZuExtensionAttributes") when it is a dictionary.
  DictionaryRef attributes() const;
  // attribute("ZuExtensionVersion"), as the info dictionary holds it.
  ValueRef version() const;
  // The version when it is a string.
  std::optional<std::string> versionString() const;
  // pluginKey("ZuExtensionProtocol"); "ZuObject" for an application extension without one.
  ValueRef protocolSpec() const;
  // pluginKey("PrincipalClass"); "ZuObject" for an application extension without one.
  ValueRef principalSpec() const;
  // pluginKey("ZuExtensionPointIdentifier").
  ValueRef sdkSpec() const;
  // The path ends with ".appex" (case-sensitive).
  bool isAppExtension() const;
  // "EmbeddedCode" is present, whatever its value.
  bool isHybrid() const;
  // "Dedicated" is boolean true or a non-zero number.
  bool isDedicated() const;
  // The protocol is "#Data": a plug-in without code.
  bool isData() const;
  // What isDedicated and isData make of the values they read, for records that keep the facts.
  static bool isDedicatedValue(const Value* dedicated);
  static bool isDataProtocol(const Value* protocol);

  // Lookups: the bundle info's value, the plug-in dictionary's value, the attributes' value.
  virtual ValueRef infoKey(std::string_view key) const;
  virtual ValueRef pluginKey(std::string_view key) const;
  virtual ValueRef attribute(std::string_view key) const;

  // The form that carries this record to a host.
  FormExport exportForm() const;
  // annotations = form["annotations"] (absent unless it is a dictionary).
  void updateFromForm(const Dictionary& form);
  // Sets (or, for an absent value, removes) one annotation. A record without an annotations
  // dictionary is left without one.
  void setAnnotation(std::string_view key, std::optional<Value> value);

  // The first reason, in a fixed order, why this plug-in's definition is invalid ("Ekora"
  // domain, code 12); nothing when it is valid.
  virtual std::optional<EkError> diagnose() const;

  // Merges the extension point's SDK dictionary into the bundle info (the plug-in's own values
  // win, except "CleanTimeout"; "Shared" lists are joined), then canonicalizes. Calling it on a
  // record without bundle info is a broken invariant (std::logic_error).
  void resolveSDK();
  // The SDK dictionary of an extension point. The base has no registry: it logs that the SDK is
  // not registered and answers nothing.
  virtual std::optional<Dictionary> readSDKDictionary(std::string_view extensionPoint) const;
  // A copy of target with sdk merged in, at every depth. Where the target holds a value that
  // is not a dictionary under a key whose SDK value is one, the target's value stays.
  static Dictionary mergeDictionary(const Dictionary& sdk, const Dictionary& target);
  static bool sdkOverridesKey(std::string_view key);
  // The union of two "Shared" lists (a string counts as a one-element list), sorted and without
  // duplicates. Only strings are paths: other elements are dropped.
  static Array mergeSharedResources(const Value* sdkList, const Value* plugInList);
  // Gives the plug-in dictionary an attributes dictionary, and the attributes a
  // "ZuExtensionVersion" (the bundle's short version string, or "1").
  void canonicalize();

  // The info values for keys, the localized names standing in for "QvBundleName" and
  // "QvBundleDisplayName"; keys without a value are left out. Fails (code -1) when the record
  // has no stored bundle info.
  Result<Dictionary> localizedInfoDictionaryForKeys(const std::vector<std::string>& keys) const;
  // The same, answered through a completion that runs exactly once before this returns.
  void localizedInfoDictionaryForKeys(
      const std::vector<std::string>& keys,
      const std::function<void(std::optional<Dictionary>, std::optional<EkError>)>& completion)
      const;

  // "<identifier>(<UUID>) at <path>", for logs.
  std::string description() const;

 protected:
  EkPlugInCore() = default;

  // Set-up followed by the info fallback: what createWithName runs on a new record. Subclasses
  // build their records through this.
  bool initWithName(std::optional<std::string> identifier, std::optional<EkFileURL> url,
                    const Value* bundleInfo, const Dictionary* info, std::optional<Uuid> uuid);

  void setDataContainerURL(std::optional<EkFileURL> url) { dataContainerURL_ = std::move(url); }
  // The bundle info field itself, whatever a subclass's bundleInfoDictionary answers.
  DictionaryRef storedBundleInfoDictionary() const;

 private:
  template <typename T>
  T read(const T& field) const {
    std::lock_guard lock(mutex_);
    return field;
  }
  template <typename T>
  void write(T& field, T value) {
    std::lock_guard lock(mutex_);
    field = std::move(value);
  }

  mutable std::mutex mutex_;
  bool onSystemVolume_ = false;
  DictionaryRef plugInDictionary_;
  std::optional<std::string> identifier_;
  std::optional<std::string> originalIdentifier_;
  std::optional<EkFileURL> url_;
  std::optional<EkFileURL> containingUrl_;
  DictionaryRef bundleInfoDictionary_;
  DictionaryRef entitlements_;
  uint32_t hubProtocolVersion_ = 0;
  std::optional<std::string> localizedName_;
  std::optional<std::string> localizedShortName_;
  std::optional<std::string> localizedContainingName_;
  DictionaryRef localizedFileProviderActionNames_;
  DictionaryRef annotations_;
  int32_t lastModified_ = 0;
  std::optional<Uuid> uuid_;
  std::optional<Data> cdhash_;
  std::optional<std::string> requirement_;
  std::optional<EkFileURL> dataContainerURL_;
};

}  // namespace ek
