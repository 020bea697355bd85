#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "Ekora/EkPlugInCore.h"
#include "Ekora/EkSandbox.h"
#include "Ekora/EkSandboxExtension.h"
#include "platform/value/EkError.h"
#include "platform/value/Uuid.h"
#include "platform/value/Value.h"
#include "platform/vantor/Registry.h"

namespace ek {

class EkDPlugIn;
class EkDClientProcess;
namespace types {
class TypeSystem;
}
namespace stard {
class ServiceManager;
}
namespace privo {
class Consent;
}

// What a daemon record needs from the daemon around it. The database that builds records hands
// every record the same context.
struct EkDPlugInContext {
  // Where the record refreshes its info dictionary, its SDK and its localized strings from.
  // Required.
  std::shared_ptr<vantor::Registry> registry;
  // Issues the extension tokens of augmentForm and issueResourceExtensions; null means the
  // process's sandbox.
  std::shared_ptr<EkSandbox> sandbox;
  // The system volume: plug-ins outside any application must lie below it. Empty means
  // $EKORA_SYSTEM_ROOT (else /System).
  std::string systemRoot;
  // The plug-in's stored annotation (the database's annotationForPlugIn), read by matching on
  // "ZuUserElection". Absent means no annotations are known. Runs where the
  // database runs.
  std::function<std::optional<Dictionary>(const EkDPlugIn&)> annotations;
  // The type system that "?TY-CONFORMS:", "?TY-IS:" and activation rules consult; null means
  // types::TypeSystem::system().
  std::shared_ptr<types::TypeSystem> types;
  // Where enableForClient declares the plug-in for a host and checkBusy finds its running
  // instances; null means enabling fails (code 4) and nothing is busy.
  std::shared_ptr<stard::ServiceManager> serviceManager;
  // The privacy consent that allowedPrivoServices reads; null means nothing is granted.
  std::shared_ptr<privo::Consent> consent;
};

// The daemon's record of one installed plug-in, built from the registry's proxy. Beside the
// base record it knows the registry's current info dictionary (re-read whenever the registry's
// knowledge UUID changes), the plug-in's entitlements and data container, and which sandbox
// extensions a host receives with the plug-in's form.
//
// Lookups (infoKey, pluginKey, attribute and everything derived from them: protocolSpec,
// isData, isDedicated, version, ...) read the registry's current info dictionary, never the
// plug-in dictionary stored at construction; exportForm's "info" still carries the latter.
//
// A record exists only for a proxy with a bundle URL whose definition passed diagnose.
// Thread-safe once built.
class EkDPlugIn : public EkPlugInCore {
 public:
  // A record for proxy, or nullptr when the proxy has no bundle URL (silently) or the
  // plug-in is mis-configured (logged at info level in "ops").
  static std::shared_ptr<EkDPlugIn> createWithVRData(const vantor::PlugInProxy& proxy,
                                                     EkDPlugInContext context);

  // A fresh proxy for this plug-in: by UUID, else (logged in "vr") by bundle URL.
  vantor::PlugInProxyPtr getProxy() const;

  // The registry's info dictionary and what discovery reads of it, found once per fetch.
  // Checking a plug-in for a host evaluates it against one of these, so that the answers of
  // one request agree with each other even when the registry changes meanwhile; the
  // pointers point into info.
  struct CurrentInfo {
    DictionaryRef info;
    // "ZuExtension" of info, and that one's "ZuExtensionAttributes", when dictionaries.
    const Dictionary* plugIn = nullptr;
    const Dictionary* attributes = nullptr;
    bool appExtension = false;                // isAppExtension
    bool dedicated = false;                   // isDedicated
    bool data = false;                        // isData
    const Value* version = nullptr;           // attribute "ZuExtensionVersion"
    const Value* bundleIdentifier = nullptr;  // infoKey "QvBundleIdentifier"
    const Value* shared = nullptr;            // pluginKey "Shared"
    const Value* hostEntitlement = nullptr;   // pluginKey "ZuExtensionHostEntitlement"
    // The bundle directory as registered; rights to the bundle need it to be still in place.
    std::optional<EkBundleIdentity> bundle;
    // Tokens issued while this info is current and handed out again instead of issued anew
    // for every form: the bundle's own read extension, given only after the directory is
    // checked again each time, and the service extension. A change of the record (a new
    // info) starts without them.
    struct Tokens {
      std::mutex mutex;
      std::string bundle;   // guarded by mutex; empty until issued
      std::string service;  // guarded by mutex; empty until issued
    };
    std::shared_ptr<Tokens> tokens = std::make_shared<Tokens>();

    const Value* plugInValue(std::string_view key) const;
    const Value* attribute(std::string_view key) const;
  };
  using CurrentInfoRef = std::shared_ptr<const CurrentInfo>;
  // The current info, fetched again when the registry's knowledge UUID has changed. Never
  // null; its info is absent after a failed fetch.
  CurrentInfoRef currentInfo() const;

  // The registry's info dictionary for this plug-in, fetched again when the registry's
  // knowledge UUID differs from the one of the last fetch. Absent after a failed fetch until
  // the registry changes again.
  DictionaryRef bundleInfoDictionary() const override;
  ValueRef infoKey(std::string_view key) const override;
  // The value inside the info dictionary's "ZuExtension".
  ValueRef pluginKey(std::string_view key) const override;
  // The value inside "ZuExtensionAttributes" of "ZuExtension".
  ValueRef attribute(std::string_view key) const override;

  // The database rebuilds a cached record that is no longer valid; a record never becomes
  // invalid (its info dictionary follows the registry by itself).
  bool isStillValid() const { return true; }

  // The value of one of the plug-in's entitlements, or nullptr.
  ValueRef valueForEntitlement(std::string_view key) const;
  // Held: present and not boolean false.
  bool hasEntitlement(std::string_view key) const;
  // The key the plug-in's annotations are filed under: the identifier named by its
  // "com.corvane.developer.replace-plugin" entitlement when that is a string, so a
  // replacement shares the elections of the plug-in it replaces; otherwise its own identifier.
  std::string annotationKey() const;
  // The integer an election value stands for, wherever one is read or accepted: a number
  // (wrapped or saturated to 64 bits, NaN as 0), or a boolean as 0 or 1. Absent for any
  // other value.
  static std::optional<int64_t> electionNumber(const Value& value);

  // Attribute matching. Never fails: anything that cannot be interpreted does not match.
  // Every key/pattern pair of rules must match; absent or empty rules match every plug-in.
  bool match(const Dictionary* rules) const;
  bool match(const Dictionary* rules, const CurrentInfo& current) const;
  bool matchKey(std::string_view key, const Value& pattern) const;
  bool matchKey(std::string_view key, const Value& pattern, const CurrentInfo& current) const;
  // A string pattern, or an array whose string elements are tried in turn.
  bool matchValue(std::string_view value, const Value& patterns) const;
  // One pattern string, with its leading operator ("?TY-CONFORMS:", "?TY-IS:", "<>", "<=",
  // ">=", "=", "<", ">" or none).
  bool matchValue(std::string_view value, std::string_view pattern) const;
  // The plug-in's activation rule (value) against a host's item description.
  bool matchDictionary(const Value& value, const Dictionary& pattern) const;

  // Host permission: nothing when the host may use this plug-in, else the reason.
  std::optional<std::string> allowForClient(const EkDClientProcess& client) const;
  std::optional<std::string> allowForClient(const EkDClientProcess& client,
                                            const CurrentInfo& current) const;

  // Declares the plug-in's executable to the service manager as an external service of the
  // host, with its environment (the host's environment, then the data container's HOME,
  // QVFIXED_USER_HOME and TMPDIR, then the plug-in's own "EnvironmentVariables") and its
  // sandbox profile. Nothing on success, else code 4. Host entries that are not strings, or
  // that no process environment could carry, are dropped.
  std::optional<EkError> enableForClient(const EkDClientProcess& client,
                                         const Dictionary* environment) const;
  // The consent services the user granted to the containing application, sorted; empty for
  // a plug-in outside any application.
  std::vector<std::string> allowedPrivoServices() const;
  // A description of the first busy instance of this plug-in ({kExtensionBundleIdentifierKey:
  // its bundle identifier}), or nothing when none is busy.
  std::optional<Dictionary> checkBusy() const;

  // The base checks, then: a plug-in with code needs a data container, and a plug-in outside
  // any application must lie on the system volume. Code 12.
  std::optional<EkError> diagnose() const override;
  // The extension point's SDK dictionary as the registry recorded it.
  std::optional<Dictionary> readSDKDictionary(std::string_view extensionPoint) const override;

  // Adds to a form about to go to a host: "extensions" (read access to the shared resource
  // paths; only the bundle itself for an application extension) and, for a plug-in with code,
  // "service-extension" (the right to look up its service). Failures are logged and leave
  // their entry out.
  void augmentForm(Dictionary& form) const;
  void augmentForm(Dictionary& form, const CurrentInfo& current) const;
  // Read-only file extensions for bundle-relative paths (a string, or an array whose strings
  // are paths; "." is the bundle itself): path to token. A path that fails, or that resolves
  // outside the bundle, is logged and left out. Absent only when paths is neither a string
  // nor an array.
  // Each is issued only while the bundle's directory is the registered one
  // (issueBundleExtension).
  std::optional<Dictionary> issueResourceExtensions(const Value& paths) const;
  std::optional<Dictionary> issueResourceExtensions(const Value& paths,
                                                    const CurrentInfo& current) const;
  // A read-only extension for the whole bundle, as issueBundleExtension issues it.
  Result<std::string> issueBundleExtension() const;

  // The info dictionary as last fetched, and the knowledge UUID of that fetch (absent before
  // the first one). Neither refreshes.
  DictionaryRef infoDmap() const;
  std::optional<Uuid> vrKnowledgeUUID() const;

  const EkDPlugInContext& context() const { return context_; }

  // An annotation as a reply carries it (CBOR). Ten thousand records keep one each: the bytes
  // share one allocation with their count.
  struct EncodedAnnotation {
    std::shared_ptr<const uint8_t[]> bytes;
    uint32_t size = 0;
    std::span<const uint8_t> span() const { return {bytes.get(), size}; }
  };
  // The database's note of this plug-in's annotation, with the annotation store's generation
  // it was read in (0: not read yet). A reply of hundreds of forms then finds the annotations
  // beside the records it walks already.
  struct AnnotationNote {
    uint64_t generation = 0;
    EncodedAnnotation encoded;
  };
  AnnotationNote annotationNote() const;
  void setAnnotationNote(AnnotationNote note) const;

 private:
  explicit EkDPlugIn(EkDPlugInContext context);

  bool initWithVRData(const vantor::PlugInProxy& proxy);
  EkSandbox& sandbox() const;
  // The read extension for the bundle itself, or the service extension, from current's
  // tokens or issued and kept there.
  Result<std::string> bundleItselfExtension(const std::string& bundlePath,
                                            const CurrentInfo& current) const;
  Result<std::string> serviceExtension(std::string_view service, const CurrentInfo& current) const;
  CurrentInfoRef makeCurrentInfo(DictionaryRef info, const vantor::PlugInProxy* proxy) const;
  // infoKey without sharing ownership, for lookups against one CurrentInfo.
  const Value* infoValue(const CurrentInfo& current, std::string_view key) const;

  const EkDPlugInContext context_;

  // Serialises refreshes; the fields below have their own lock so readers never wait for a
  // registry lookup.
  mutable std::mutex refreshMutex_;
  mutable std::mutex infoMutex_;
  mutable CurrentInfoRef current_;
  mutable std::optional<Uuid> vrKnowledgeUUID_;
  mutable AnnotationNote annotationNote_;  // guarded by infoMutex_
};

// File-provider action names of an extension dictionary ("ZuExtensionFileProviderActions",
// each element's "ZuExtensionFileProviderActionName"), each mapped to its localized title from
// the plug-in's "Localizable" strings table, or to itself when the table has none. Elements
// without a name are logged in "vr" and skipped. Always a dictionary.
Dictionary localizedFileProviderActionNamesForEkDict(const vantor::PlugInProxy& proxy,
                                                     const Dictionary* extensionDictionary,
                                                     vantor::Registry& registry);

}  // namespace ek
