#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/value/Result.h"
#include "platform/value/Uuid.h"
#include "platform/value/Value.h"
#include "platform/vantor/SdkMerge.h"

// Vantor, the application registry: which applications and plug-ins are installed, with the
// facts the daemon builds its plug-in records from.
namespace ek::vantor {

// Errors of the registry itself; failures of the operating system keep the POSIX domain.
inline constexpr std::string_view kErrorDomain = "Vantor";
enum ErrorCode : int32_t {
  kNotRegistered = 1,      // no bundle is registered at that path
  kMalformedBundle = 2,    // Info.dmap missing, unreadable or not shaped like a bundle's
  kInvalidIdentifier = 3,  // a plug-in identifier that cannot name a data container
  kDatabase = 4,           // SQLite failed
  kInUse = 5,              // another process holds the registry database
};
EkError makeError(ErrorCode code, std::string message);

// Info-dictionary keys the registry reads.
inline constexpr std::string_view kBundleIdentifierKey = "QvBundleIdentifier";
inline constexpr std::string_view kBundleExecutableKey = "QvBundleExecutable";
inline constexpr std::string_view kBundleVersionKey = "QvBundleVersion";
inline constexpr std::string_view kBundleNameKey = "QvBundleName";
inline constexpr std::string_view kBundleDisplayNameKey = "QvBundleDisplayName";
inline constexpr std::string_view kExtensionKey = "ZuExtension";
inline constexpr std::string_view kExtensionPointKey = "ZuExtensionPointIdentifier";
inline constexpr std::string_view kExtensionAttributesKey = "ZuExtensionAttributes";
inline constexpr std::string_view kExtensionProtocolKey = "ZuExtensionProtocol";
// The protocol of a data-only plug-in: it has no code, so it runs nowhere and gets no container.
inline constexpr std::string_view kDataProtocol = "#Data";

// The bundle directory a plug-in was registered from: what was read at registration is what
// lay in this directory, so rights to the bundle are handed out only while the directory at
// the plug-in's path is still this one.
struct BundleIdentity {
  uint64_t device = 0;
  uint64_t inode = 0;
  std::string canonicalPath;  // links resolved, at registration
  bool operator==(const BundleIdentity&) const = default;
};

// One installed plug-in as the registry knows it. A plain value: it never changes after it is
// handed out and stays valid after the plug-in is unregistered.
struct PlugInProxy {
  Uuid uuid;
  std::string identifier;          // QvBundleIdentifier
  std::string originalIdentifier;  // the identifier it was registered under
  std::optional<std::string> bundleVersion;
  std::string path;  // absolute, normalised, no trailing slash
  std::string url;   // file URL of path
  std::optional<std::string> containingAppPath;
  std::optional<std::string> containingAppName;  // localized
  // Info.dmap with the SDK dictionary merged in (mergeSdk) and
  // ZuExtensionPointIdentifier copied into ZuExtensionAttributes when it was missing there.
  Dictionary info;
  Dictionary sdk;  // the extension point's SDK dictionary; empty when it has none
  Dictionary entitlements;
  Date registrationDate;
  std::optional<std::string> dataContainerPath;  // absent for a data-only plug-in
  std::optional<std::string> localizedName;
  std::optional<std::string> localizedShortName;
  std::optional<std::string> extensionPoint;  // ZuExtension's ZuExtensionPointIdentifier
  bool onSystemVolume = false;                // path lies under $EKORA_SYSTEM_ROOT
  // Absent when the registry did not record it (a record from before it did): such a bundle
  // gets no rights until it is registered again.
  std::optional<BundleIdentity> bundleIdentity;
  // The registry's knowledge UUID when this proxy was read, so that a holder knows it is
  // current until the knowledge changes; absent when the registry does not say.
  std::optional<Uuid> knowledge;

  // info["ZuExtension"], or nullptr.
  const Dictionary* extensionDictionary() const;
  std::string description() const;
};
using PlugInProxyPtr = std::shared_ptr<const PlugInProxy>;

struct ApplicationProxy {
  std::string identifier;  // QvBundleIdentifier
  std::string path;
  std::string url;
  std::optional<std::string> name;  // localized
  std::optional<std::string> bundleVersion;
  Dictionary info;
  Date registrationDate;
  bool isPlaceholder = false;     // this registry never makes placeholders
  std::vector<Uuid> plugInUuids;  // in path order
};
using ApplicationProxyPtr = std::shared_ptr<const ApplicationProxy>;

// Receives the registry's notices, on the registry's own serial queue. Install notices come
// after the change is committed; uninstall notices come before the rows are deleted, so the
// proxies can still be looked up while the notice runs. A notice must not register or
// unregister bundles synchronously (hand that to another queue).
class RegistryObserver {
 public:
  virtual ~RegistryObserver() = default;
  virtual void pluginsDidInstall(const std::vector<PlugInProxyPtr>& plugIns) = 0;
  virtual void pluginsWillUninstall(const std::vector<PlugInProxyPtr>& plugIns) = 0;
  // The current language changed; localized names in proxies handed out before are stale.
  virtual void localeDidChange() {}
};

// Runs per query candidate, outside the registry's locks (it may call the registry).
using PlugInFilter = std::function<bool(const PlugInProxy&)>;

// The application registry. Every member may be called from any thread.
class Registry {
 public:
  virtual ~Registry() = default;

  // Registers a plug-in bundle, or an application bundle with every plug-in in its PlugIns
  // directory. All or nothing: on an error nothing is registered or unregistered.
  virtual Result<void> registerBundle(const std::string& path) = 0;
  // Unregisters a plug-in bundle, or an application with all its plug-ins. Data containers
  // are kept.
  virtual Result<void> unregisterBundle(const std::string& path) = 0;

  virtual PlugInProxyPtr plugInByUuid(const Uuid& uuid) = 0;
  // A file URL (a trailing slash names the same bundle) or an absolute path.
  virtual PlugInProxyPtr plugInByUrl(std::string_view urlOrPath) = 0;
  // In path order; empty when the application is unknown or has no plug-ins.
  virtual std::vector<PlugInProxyPtr> plugInsOfApplication(std::string_view appPath) = 0;
  virtual std::vector<PlugInProxyPtr> installedPlugIns() = 0;
  virtual ApplicationProxyPtr applicationByPath(std::string_view urlOrPath) = 0;
  virtual ApplicationProxyPtr applicationByIdentifier(std::string_view identifier) = 0;

  // The plug-ins a query dictionary may select, each passed through filter (when given).
  // Only ZuExtensionPointIdentifier narrows the candidates (see indexedExtensionPoints);
  // every other key is the caller's to match.
  virtual std::vector<PlugInProxyPtr> query(const Dictionary& rules,
                                            const PlugInFilter& filter) = 0;
  // The UUIDs of the plug-ins query would pass to its filter, in the order it would, without
  // reading their records: a caller holding current records for them needs nothing more.
  virtual std::vector<Uuid> queryUuids(const Dictionary& rules);
  // How many plug-ins are registered.
  virtual size_t plugInCount();
  // Whether the application at a path is known and only a placeholder.
  virtual bool applicationIsPlaceholder(std::string_view path);

  // The SDK dictionary of an extension point, when one was read at registration.
  virtual std::optional<Dictionary> extensionPointSdk(std::string_view identifier) = 0;
  // Localized values of keys from the strings table <bundle>/<language>.lproj/<table>.strings
  // of the plug-in, in the current language; keys without a value are left out.
  virtual Dictionary localizedStrings(const Uuid& plugIn, std::string_view table,
                                      const std::vector<std::string>& keys) = 0;

  // Changes whenever the registry changes.
  virtual Uuid knowledgeUuid() = 0;
  // Drops in-process caches (the daemon's cache purge asks for it).
  virtual void clearCaches() = 0;
  // Moves everything the registry's log holds into its main file and gives free space back,
  // so that the file alone is the registry; the daemon asks for it when it stops.
  virtual void checkpoint() {}
  // What a scan of the system volume found.
  struct SystemVolumeScan {
    size_t bundles = 0;    // bundle directories seen
    size_t unchanged = 0;  // left alone: none of their files changed since they were read
    size_t read = 0;       // read again (registered, or found registered as they read)
  };
  // Brings the system volume's plug-ins up to date with the bundles there now, as at start.
  // Takes as long as reading what changed; does nothing by default. Lookups and changes from
  // other threads go on meanwhile and see the bundles registered so far.
  virtual SystemVolumeScan rescanSystemVolume() { return {}; }

  // Observers are held weakly; one that is gone is dropped.
  virtual void addObserver(std::weak_ptr<RegistryObserver> observer) = 0;
  virtual void removeObserver(const std::shared_ptr<RegistryObserver>& observer) = 0;
};

// --- Rules shared by every implementation -------------------------------------------------

// A plug-in identifier names its data container directory, so it must be one path component:
// not empty, not "." or "..", no "/" and no NUL, at most 255 bytes.
Result<void> checkPlugInIdentifier(std::string_view identifier);

// The extension points a query is answered from: rules' ZuExtensionPointIdentifier when it is
// a string without a leading match operator ("?", "<", ">", "="), or an array of values whose
// strings are all without one (non-strings in the array can never match and are skipped).
// Absent when the rules do not narrow by extension point.
std::optional<std::vector<std::string>> indexedExtensionPoints(const Dictionary& rules);
// The values under which a plug-in is indexed: what a rule on ZuExtensionPointIdentifier is
// matched against (the attribute, else the top-level info key; each string of an array).
std::vector<std::string> extensionPointIndexValues(const Dictionary& mergedInfo);
// The index key of a value: digit runs lose their leading zeros, because rule values compare
// runs of digits by number; the index may then answer a few more candidates, never fewer.
std::string extensionPointIndexKey(std::string_view value);

// The identity of the directory open as directoryFd, which was opened by path: its device and
// inode, and path with links resolved. Absent when that is not a directory or the resolved
// path no longer names it (it was replaced meanwhile).
std::optional<BundleIdentity> bundleIdentityOf(int directoryFd, const std::string& path);
// The same for the directory at path now.
std::optional<BundleIdentity> bundleIdentityOf(const std::string& path);

// file:// URL of an absolute path, percent-encoded as RFC 3986 writes a path.
std::string fileUrlForPath(std::string_view path);
// The normalised absolute path of a file URL or an absolute path; absent for anything else
// (other schemes, a host other than empty or "localhost", relative paths, bad escapes, NUL).
std::optional<std::string> pathFromUrlOrPath(std::string_view text);

// Language tags to try for a strings table, best first: "fr_CA.UTF-8@euro" gives fr_CA, fr.
std::vector<std::string> languageCandidates(std::string_view language);
// The current language: the first line of <stateDir>/locale when that file exists, else
// EKORA_LOCALE, LC_ALL, LC_MESSAGES, LANG (the first one set and not empty), else "en".
// "C" and "POSIX" mean "en".
std::string currentLanguage(const std::string& stateDir);
// The pieces of currentLanguage: the locale file's first line (absent when the file is
// missing, unreadable or its first line empty) and the environment's choice.
std::optional<std::string> readLocaleFile(const std::string& path);
std::string environmentLanguage();

}  // namespace ek::vantor
