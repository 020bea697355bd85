#pragma once

#include <map>
#include <mutex>
#include <set>

#include "platform/queue/SerialQueue.h"
#include "platform/vantor/Registry.h"

namespace ek::vantor {

// An in-memory registry for daemon unit tests: proxies are inserted directly, nothing is read
// from disk. Queries, notices and the knowledge UUID follow the same rules as SqliteRegistry.
// Thread-safe.
class FakeRegistry : public Registry {
 public:
  // Notices are delivered on queue (a new serial queue when none is given).
  explicit FakeRegistry(std::shared_ptr<SerialQueue> queue = nullptr);

  // Adds or replaces (by UUID) a plug-in and tells observers it was installed.
  void install(PlugInProxy proxy);
  // Tells observers the plug-in is about to go, then drops it. False when it is unknown.
  bool uninstall(const Uuid& uuid);
  void addApplication(ApplicationProxy proxy);
  void setExtensionPointSdk(std::string identifier, Dictionary sdk);
  void setLocalizedStrings(const Uuid& plugIn, std::string table, Dictionary strings);
  // What registerBundle and unregisterBundle answer, and the paths they were called with.
  void setRegisterResult(Result<void> result);
  void setUnregisterResult(Result<void> result);
  std::vector<std::string> registeredPaths() const;
  std::vector<std::string> unregisteredPaths() const;
  // Raises the locale-change notice.
  void changeLocale();
  int clearCachesCount() const;

  Result<void> registerBundle(const std::string& path) override;
  Result<void> unregisterBundle(const std::string& path) override;
  PlugInProxyPtr plugInByUuid(const Uuid& uuid) override;
  PlugInProxyPtr plugInByUrl(std::string_view urlOrPath) override;
  std::vector<PlugInProxyPtr> plugInsOfApplication(std::string_view appPath) override;
  std::vector<PlugInProxyPtr> installedPlugIns() override;
  ApplicationProxyPtr applicationByPath(std::string_view urlOrPath) override;
  ApplicationProxyPtr applicationByIdentifier(std::string_view identifier) override;
  std::vector<PlugInProxyPtr> query(const Dictionary& rules, const PlugInFilter& filter) override;
  std::optional<Dictionary> extensionPointSdk(std::string_view identifier) override;
  Dictionary localizedStrings(const Uuid& plugIn, std::string_view table,
                              const std::vector<std::string>& keys) override;
  Uuid knowledgeUuid() override;
  void clearCaches() override;
  void addObserver(std::weak_ptr<RegistryObserver> observer) override;
  void removeObserver(const std::shared_ptr<RegistryObserver>& observer) override;

  const std::shared_ptr<SerialQueue>& queue() const { return queue_; }

 private:
  std::vector<std::shared_ptr<RegistryObserver>> liveObservers();
  std::vector<PlugInProxyPtr> sortedLocked() const;

  std::shared_ptr<SerialQueue> queue_;
  mutable std::mutex mutex_;
  std::map<Uuid, PlugInProxyPtr> plugIns_;
  std::map<std::string, ApplicationProxyPtr, std::less<>> applications_;  // by path
  std::map<std::string, Dictionary, std::less<>> sdks_;
  std::map<std::pair<Uuid, std::string>, Dictionary> strings_;
  std::vector<std::weak_ptr<RegistryObserver>> observers_;
  Result<void> registerResult_;
  Result<void> unregisterResult_;
  std::vector<std::string> registered_;
  std::vector<std::string> unregistered_;
  Uuid knowledge_ = Uuid::random();
  int clearCaches_ = 0;
};

}  // namespace ek::vantor
