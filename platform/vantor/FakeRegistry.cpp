#include "platform/vantor/FakeRegistry.h"

#include <algorithm>

namespace ek::vantor {

FakeRegistry::FakeRegistry(std::shared_ptr<SerialQueue> queue)
    : queue_(queue ? std::move(queue) : SerialQueue::make("com.corvane.vantor.fake")) {}

void FakeRegistry::install(PlugInProxy proxy) {
  if (proxy.url.empty()) proxy.url = fileUrlForPath(proxy.path);
  // As registration does: the directory at the path now is the one registered.
  if (!proxy.bundleIdentity) proxy.bundleIdentity = bundleIdentityOf(proxy.path);
  auto shared = std::make_shared<const PlugInProxy>(std::move(proxy));
  {
    std::lock_guard lock(mutex_);
    plugIns_[shared->uuid] = shared;
    knowledge_ = Uuid::random();
  }
  queue_->async([observers = liveObservers(), shared] {
    for (const auto& observer : observers) observer->pluginsDidInstall({shared});
  });
}

bool FakeRegistry::uninstall(const Uuid& uuid) {
  PlugInProxyPtr proxy = plugInByUuid(uuid);
  if (!proxy) return false;
  // Told before the plug-in goes, as the registry does, on its queue.
  auto observers = liveObservers();
  auto deliver = [&] {
    for (const auto& observer : observers) observer->pluginsWillUninstall({proxy});
  };
  if (!observers.empty()) queue_->isCurrent() ? deliver() : queue_->sync(deliver);
  std::lock_guard lock(mutex_);
  plugIns_.erase(uuid);
  knowledge_ = Uuid::random();
  return true;
}

void FakeRegistry::addApplication(ApplicationProxy proxy) {
  if (proxy.url.empty()) proxy.url = fileUrlForPath(proxy.path);
  std::lock_guard lock(mutex_);
  std::string path = proxy.path;
  applications_[path] = std::make_shared<const ApplicationProxy>(std::move(proxy));
  knowledge_ = Uuid::random();
}

void FakeRegistry::setExtensionPointSdk(std::string identifier, Dictionary sdk) {
  std::lock_guard lock(mutex_);
  sdks_[std::move(identifier)] = std::move(sdk);
}

void FakeRegistry::setLocalizedStrings(const Uuid& plugIn, std::string table, Dictionary strings) {
  std::lock_guard lock(mutex_);
  strings_[{plugIn, std::move(table)}] = std::move(strings);
}

void FakeRegistry::setRegisterResult(Result<void> result) {
  std::lock_guard lock(mutex_);
  registerResult_ = std::move(result);
}

void FakeRegistry::setUnregisterResult(Result<void> result) {
  std::lock_guard lock(mutex_);
  unregisterResult_ = std::move(result);
}

std::vector<std::string> FakeRegistry::registeredPaths() const {
  std::lock_guard lock(mutex_);
  return registered_;
}

std::vector<std::string> FakeRegistry::unregisteredPaths() const {
  std::lock_guard lock(mutex_);
  return unregistered_;
}

void FakeRegistry::changeLocale() {
  queue_->async([observers = liveObservers()] {
    for (const auto& observer : observers) observer->localeDidChange();
  });
}

int FakeRegistry::clearCachesCount() const {
  std::lock_guard lock(mutex_);
  return clearCaches_;
}

Result<void> FakeRegistry::registerBundle(const std::string& path) {
  std::lock_guard lock(mutex_);
  registered_.push_back(path);
  return registerResult_;
}

Result<void> FakeRegistry::unregisterBundle(const std::string& path) {
  std::lock_guard lock(mutex_);
  unregistered_.push_back(path);
  return unregisterResult_;
}

PlugInProxyPtr FakeRegistry::plugInByUuid(const Uuid& uuid) {
  std::lock_guard lock(mutex_);
  auto it = plugIns_.find(uuid);
  return it == plugIns_.end() ? nullptr : it->second;
}

PlugInProxyPtr FakeRegistry::plugInByUrl(std::string_view urlOrPath) {
  auto path = pathFromUrlOrPath(urlOrPath);
  auto all = installedPlugIns();
  auto it = std::find_if(all.begin(), all.end(), [&](const auto& p) { return p->path == path; });
  return it == all.end() ? nullptr : *it;
}

std::vector<PlugInProxyPtr> FakeRegistry::sortedLocked() const {
  std::vector<PlugInProxyPtr> all;
  for (const auto& [uuid, proxy] : plugIns_) all.push_back(proxy);
  std::sort(all.begin(), all.end(), [](const auto& a, const auto& b) { return a->path < b->path; });
  return all;
}

std::vector<PlugInProxyPtr> FakeRegistry::plugInsOfApplication(std::string_view appPath) {
  auto path = pathFromUrlOrPath(appPath);
  auto all = installedPlugIns();
  std::erase_if(all, [&](const auto& p) { return !path || p->containingAppPath != *path; });
  return all;
}

std::vector<PlugInProxyPtr> FakeRegistry::installedPlugIns() {
  std::lock_guard lock(mutex_);
  return sortedLocked();
}

ApplicationProxyPtr FakeRegistry::applicationByPath(std::string_view urlOrPath) {
  auto path = pathFromUrlOrPath(urlOrPath);
  std::lock_guard lock(mutex_);
  auto it = path ? applications_.find(*path) : applications_.end();
  return it == applications_.end() ? nullptr : it->second;
}

ApplicationProxyPtr FakeRegistry::applicationByIdentifier(std::string_view identifier) {
  std::lock_guard lock(mutex_);
  for (const auto& [path, proxy] : applications_) {
    if (proxy->identifier == identifier) return proxy;
  }
  return nullptr;
}

std::vector<PlugInProxyPtr> FakeRegistry::query(const Dictionary& rules,
                                                const PlugInFilter& filter) {
  std::vector<PlugInProxyPtr> candidates = installedPlugIns();
  std::set<std::string> keys;
  auto points = indexedExtensionPoints(rules);
  for (const std::string& point : points.value_or(std::vector<std::string>{})) {
    keys.insert(extensionPointIndexKey(point));
  }
  std::erase_if(candidates, [&](const PlugInProxyPtr& proxy) {
    bool indexed = !points;
    for (const std::string& value : extensionPointIndexValues(proxy->info)) {
      indexed = indexed || keys.contains(extensionPointIndexKey(value));
    }
    return !indexed || (filter && !filter(*proxy));
  });
  return candidates;
}

std::optional<Dictionary> FakeRegistry::extensionPointSdk(std::string_view identifier) {
  std::lock_guard lock(mutex_);
  auto it = sdks_.find(identifier);
  return it == sdks_.end() ? std::nullopt : std::optional(it->second);
}

Dictionary FakeRegistry::localizedStrings(const Uuid& plugIn, std::string_view table,
                                          const std::vector<std::string>& keys) {
  std::lock_guard lock(mutex_);
  Dictionary result;
  auto it = strings_.find({plugIn, std::string(table)});
  if (it == strings_.end()) return result;
  for (const std::string& key : keys) {
    if (auto value = it->second.find(key); value != it->second.end()) result.insert(*value);
  }
  return result;
}

Uuid FakeRegistry::knowledgeUuid() {
  std::lock_guard lock(mutex_);
  return knowledge_;
}

void FakeRegistry::clearCaches() {
  std::lock_guard lock(mutex_);
  ++clearCaches_;
}

void FakeRegistry::addObserver(std::weak_ptr<RegistryObserver> observer) {
  std::lock_guard lock(mutex_);
  observers_.push_back(std::move(observer));
}

void FakeRegistry::removeObserver(const std::shared_ptr<RegistryObserver>& observer) {
  std::lock_guard lock(mutex_);
  std::erase_if(observers_, [&](const std::weak_ptr<RegistryObserver>& weak) {
    auto strong = weak.lock();
    return !strong || strong == observer;
  });
}

std::vector<std::shared_ptr<RegistryObserver>> FakeRegistry::liveObservers() {
  std::lock_guard lock(mutex_);
  std::vector<std::shared_ptr<RegistryObserver>> live;
  for (const auto& weak : observers_) {
    if (auto strong = weak.lock()) live.push_back(std::move(strong));
  }
  return live;
}

}  // namespace ek::vantor
