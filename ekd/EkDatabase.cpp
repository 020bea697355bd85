#include "ekd/EkDatabase.h"

#include <algorithm>
#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <unordered_set>

#include "Ekora/EkProtocol.h"
#include "platform/cbor/Cbor.h"
#include "platform/log/Log.h"

namespace ek {
namespace {

constexpr std::string_view kUserElectionKey = "ZuUserElection";
constexpr std::string_view kElectionKey = "election";

// A list of proxies as "%@" shows an array.
struct ProxyList {
  const std::vector<vantor::PlugInProxyPtr>& proxies;
  std::string description() const {
    std::string text = "(";
    for (size_t i = 0; i < proxies.size(); ++i) {
      text += i ? ",\n    " : "\n    ";
      text += proxies[i]->description();
    }
    text += proxies.empty() ? ")" : "\n)";
    return text;
  }
};

}  // namespace

EkDatabase::~EkDatabase() = default;

bool EkDatabase::initWithDatabase(std::optional<std::string> path, EkDatabasePlatform platform,
                                  std::shared_ptr<SerialQueue> owner) {
  return initWithStore(EkDAnnotationStore::initWithDatabase(std::move(path)), std::move(platform),
                       std::move(owner));
}

bool EkDatabase::initWithStore(std::unique_ptr<EkDAnnotationStore> store,
                               EkDatabasePlatform platform, std::shared_ptr<SerialQueue> owner) {
  platform_ = std::move(platform);
  annotations_ = std::move(store);
  if (!annotations_) return false;
  owner_ = owner ? std::move(owner) : SerialQueue::make("EkDatabase");
  // The registry holds observers weakly: whoever shares this database registers it (see
  // EkDServer).
  return true;
}

EkDPlugInContext EkDatabase::recordContext() {
  EkDPlugInContext context{platform_.registry, platform_.sandbox, platform_.systemRoot};
  // The database outlives every record it builds.
  context.annotations = [this](const EkDPlugIn& plugIn) { return annotationForPlugIn(plugIn); };
  context.types = platform_.types;
  context.serviceManager = platform_.serviceManager;
  context.consent = platform_.consent;
  return context;
}

void EkDatabase::setDelegate(EkDatabaseDelegate delegate) {
  delegate_ = std::move(delegate);
}

size_t EkDatabase::cacheCount() const {
  return cache_.size();
}

void EkDatabase::setCacheCapacity(size_t capacity) {
  cache_.setCapacity(capacity);
}

EkDPlugInRef EkDatabase::RecordCache::find(const Uuid& uuid) {
  auto it = index_.find(uuid);
  if (it == index_.end()) return nullptr;
  order_.splice(order_.begin(), order_, it->second);
  return *it->second;
}

void EkDatabase::RecordCache::insert(EkDPlugInRef record) {
  const Uuid uuid = record->uuid();
  erase(uuid);
  order_.push_front(std::move(record));
  index_.emplace(uuid, order_.begin());
  evict();
}

void EkDatabase::RecordCache::erase(const Uuid& uuid) {
  auto it = index_.find(uuid);
  if (it == index_.end()) return;
  order_.erase(it->second);
  index_.erase(it);
}

void EkDatabase::RecordCache::clear() {
  index_.clear();
  order_.clear();
}

void EkDatabase::RecordCache::setCapacity(size_t capacity) {
  capacity_ = std::max<size_t>(capacity, 1);
  evict();
}

void EkDatabase::RecordCache::evict() {
  while (index_.size() > capacity_) {
    index_.erase(order_.back()->uuid());
    order_.pop_back();
  }
}

EkDPlugInRef EkDatabase::plugInForProxy(const vantor::PlugInProxy& proxy) {
  if (EkDPlugInRef cached = cache_.find(proxy.uuid)) {
    if (cached->isStillValid()) return cached;
    cache_.erase(proxy.uuid);
  }
  return createPlugInForProxy(proxy);
}

EkDPlugInRef EkDatabase::createPlugInForProxy(const vantor::PlugInProxy& proxy) {
  log::ops().defaultLevel("createPlugInForProxy");
  auto plugIn = EkDPlugIn::createWithVRData(proxy, recordContext());
  if (!plugIn) return nullptr;
  if (plugIn->hasEntitlement(protocol::kEntitlementAutoElect)) autoElect(*plugIn);
  purgeCachesToLimit(cacheLimit_.load());
  cache_.insert(plugIn);
  return plugIn;
}

void EkDatabase::purgeCachesToLimit(int64_t limit) {
  // Compared unsigned: a negative limit never purges.
  if (static_cast<uint64_t>(cache_.size()) > static_cast<uint64_t>(limit)) {
    log::ops().info("purging cache for %d > %d", cache_.size(), limit);
    cache_.clear();
    platform_.registry->clearCaches();
  }
}

void EkDatabase::localeDidChange() {
  log::ops().defaultLevel("locale change detected; purging cache");
  // The registry's thread: the cache is the owner's.
  owner_->async([weak = weak_from_this()] {
    if (auto self = weak.lock()) self->purgeCachesToLimit(0);
  });
}

std::optional<std::string> EkDatabase::normalizeElection(const Value& value) {
  const std::string* text = value.string();
  if (!text || text->empty()) return std::nullopt;
  unsigned char first = static_cast<unsigned char>((*text)[0]);
  if (first == '=') return text->substr(1);
  if (std::isalnum(first)) return *text;
  return std::nullopt;
}

std::optional<std::vector<std::string>> EkDatabase::electionList(const Dictionary& query) {
  auto it = query.find(kUserElectionKey);
  if (it == query.end()) return std::nullopt;
  std::vector<std::string> elections;
  if (const Array* array = it->second.array()) {
    elections.reserve(array->size());
    for (const Value& element : *array) {
      auto normalized = normalizeElection(element);
      if (!normalized) return std::nullopt;
      elections.push_back(std::move(*normalized));
    }
    return elections;
  }
  if (it->second.string()) {
    auto normalized = normalizeElection(it->second);
    if (!normalized) return std::nullopt;
    elections.push_back(std::move(*normalized));
    return elections;
  }
  return std::nullopt;
}

bool EkDatabase::electionFilter(const std::vector<std::string>& elections,
                                const std::string& identifier, const Dictionary& entitlements) {
  std::string key = identifier;
  auto replaces = entitlements.find(protocol::kEntitlementReplacePlugIn);
  if (replaces != entitlements.end() && replaces->second.string()) {
    key = *replaces->second.string();
  }
  std::optional<int64_t> election;
  if (const Dictionary* annotation = annotations_->findAnnotation(key)) {
    auto field = annotation->find(kElectionKey);
    if (field != annotation->end()) election = EkDPlugIn::electionNumber(field->second);
  }
  if (!election) {
    election = 0;
    auto autoElect = entitlements.find(protocol::kEntitlementAutoElect);
    if (autoElect != entitlements.end()) {
      // Only a number counts here, by its boolean value.
      const Value& value = autoElect->second;
      if (auto number = EkDPlugIn::electionNumber(value)) election = *number != 0 ? 1 : 0;
    }
  }
  std::string text = std::to_string(static_cast<uint8_t>(*election & 0xff));
  bool answer = false;
  for (const std::string& candidate : elections) {
    if (candidate == text) {
      answer = true;
      break;
    }
  }
  log::ops().debug("vr filter %@ -> %d", key, answer ? 1 : 0);
  return answer;
}

// The registry names the candidates by UUID; only those without a cached record have their
// registration read. A cached record follows the registry by itself, so it is what a proxy
// read now would be turned into anyway, and a query of 500 plug-ins reads no rows.
std::optional<std::vector<EkDPlugInRef>> EkDatabase::findPlugIns(const Dictionary& query) {
  std::optional<std::vector<std::string>> elections;
  if (!query.empty()) elections = electionList(query);
  const std::vector<Uuid> uuids = platform_.registry->queryUuids(query);
  if (log::vr().enabled(log::Level::Debug)) {
    // The line shows the registry's proxies, which only this log needs read.
    if (query.empty()) {
      auto proxies = platform_.registry->installedPlugIns();
      log::vr().debug("%d installedPlugins: %@", proxies.size(), ProxyList{proxies});
    } else {
      vantor::PlugInFilter filter;
      if (elections) {
        filter = [this, &elections](const vantor::PlugInProxy& proxy) {
          return electionFilter(*elections, proxy.identifier, proxy.entitlements);
        };
      }
      auto proxies = platform_.registry->query(query, filter);
      log::vr().debug("%d plugin(s) matching %@ = %@", proxies.size(), Value(query),
                      ProxyList{proxies});
    }
  }

  const size_t cachedBefore = cache_.size();
  size_t selected = 0;
  std::vector<EkDPlugInRef> result;
  result.reserve(uuids.size());
  std::unordered_set<Uuid> seen;
  for (size_t i = 0; i < uuids.size(); ++i) {
    const Uuid& uuid = uuids[i];
    if (!seen.insert(uuid).second) continue;
    EkDPlugInRef cached;
    if (EkDPlugInRef found = cache_.find(uuid); found && found->isStillValid()) {
      cached = std::move(found);
    }
    if (cached) {
      if (elections) {
        DictionaryRef entitlements = cached->entitlements();
        if (!electionFilter(*elections, cached->identifier().value_or(""),
                            entitlements ? *entitlements : Dictionary{})) {
          continue;
        }
      }
      ++selected;
      auto containing = cached->containingPath();
      if (containing && platform_.registry->applicationIsPlaceholder(*containing)) {
        vantor::PlugInProxyPtr proxy = cached->getProxy();
        log::ops().info("skipping vr proxy %@ because its app is a placeholder",
                        proxy ? proxy->description() : uuid.string());
        continue;
      }
      result.push_back(std::move(cached));
      continue;
    }
    vantor::PlugInProxyPtr proxy = platform_.registry->plugInByUuid(uuid);
    // Gone since the registry named it: as if the query had run a moment later.
    if (!proxy) continue;
    if (elections && !electionFilter(*elections, proxy->identifier, proxy->entitlements)) continue;
    ++selected;
    if (proxy->url.empty()) {
      log::ops().info("skipping vr proxy %@ with nil bundleURL", *proxy);
      continue;
    }
    if (proxy->containingAppPath &&
        platform_.registry->applicationIsPlaceholder(*proxy->containingAppPath)) {
      log::ops().info("skipping vr proxy %@ because its app is a placeholder", *proxy);
      continue;
    }
    if (auto plugIn = plugInForProxy(*proxy)) result.push_back(std::move(plugIn));
  }
  if (selected == 0) return std::nullopt;
  log::ops().debug("VR reported %u plug-ins (cache %u/%u)", result.size(), cachedBefore,
                   cacheCount());
  return result;
}

EkDPlugInRef EkDatabase::findPlugIn(const Uuid& uuid) {
  if (EkDPlugInRef cached = cache_.find(uuid)) {
    if (cached->isStillValid()) return cached;
    cache_.erase(uuid);
  }
  auto proxy = platform_.registry->plugInByUuid(uuid);
  if (!proxy) {
    log::ops().info("Vantor cannot find plug-in with UUID:%{public}@", uuid);
    return nullptr;
  }
  return createPlugInForProxy(*proxy);
}

EkDPlugInRef EkDatabase::findPlugInAtPath(std::string_view url) {
  auto proxy = platform_.registry->plugInByUrl(url);
  if (!proxy) {
    log::ops().info("Vantor cannot find plug-in at path:%@", url);
    return nullptr;
  }
  return findPlugIn(proxy->uuid);
}

std::optional<std::vector<EkDPlugInRef>> EkDatabase::plugInsWithinApplication(
    std::string_view appUrl) {
  auto proxies = platform_.registry->plugInsOfApplication(appUrl);
  if (proxies.empty()) return std::nullopt;
  std::vector<EkDPlugInRef> result;
  result.reserve(proxies.size());
  for (const auto& proxy : proxies) {
    if (auto plugIn = plugInForProxy(*proxy)) result.push_back(std::move(plugIn));
  }
  return result;
}

std::optional<EkError> EkDatabase::addPlugIn(std::string_view url) {
  auto path = vantor::pathFromUrlOrPath(url);
  if (path) {
    if (platform_.registry->registerBundle(*path)) return std::nullopt;
  }
  return EkError::ekora(protocol::kErrorRegistry, "Vantor failed to register the plug-in");
}

std::optional<EkError> EkDatabase::removePlugIn(std::string_view url) {
  auto path = vantor::pathFromUrlOrPath(url);
  if (path) {
    if (platform_.registry->unregisterBundle(*path)) return std::nullopt;
  }
  return EkError::ekora(protocol::kErrorRegistry, "Vantor failed to deregister the plug-in");
}

std::optional<Dictionary> EkDatabase::annotationForPlugIn(const EkDPlugIn& plugIn) {
  return annotations_->annotationForPlugIn(plugIn);
}

std::vector<EkDatabase::EncodedAnnotation> EkDatabase::encodedAnnotationsForPlugIns(
    std::span<const EkDPlugIn* const> plugIns) {
  std::vector<EncodedAnnotation> encoded(plugIns.size());
  // Every note of the store's current generation: the whole answer is that generation's.
  const uint64_t generation = annotations_->generation();
  bool noted = true;
  for (size_t i = 0; noted && i < plugIns.size(); ++i) {
    EkDPlugIn::AnnotationNote note = plugIns[i]->annotationNote();
    noted = note.generation == generation;
    encoded[i] = std::move(note.encoded);
  }
  if (noted) return encoded;

  auto kept = [](const std::vector<uint8_t>& bytes) {
    std::shared_ptr<uint8_t[]> copy = std::make_shared_for_overwrite<uint8_t[]>(bytes.size());
    std::copy(bytes.begin(), bytes.end(), copy.get());
    return EncodedAnnotation{std::move(copy), static_cast<uint32_t>(bytes.size())};
  };
  static const EncodedAnnotation kNone = kept(cbor::encode(Value(Dictionary{})));
  for (size_t i = 0; i < plugIns.size(); ++i) {
    EkDPlugIn::AnnotationNote note = plugIns[i]->annotationNote();
    if (note.generation != generation) {
      const Dictionary* annotation = annotations_->findAnnotation(plugIns[i]->annotationKey());
      note.generation = generation;
      note.encoded = annotation ? kept(cbor::encode(Value(*annotation))) : kNone;
      plugIns[i]->setAnnotationNote(note);
    }
    encoded[i] = std::move(note.encoded);
  }
  return encoded;
}

Result<void> EkDatabase::setAnnotation(const std::optional<Dictionary>& annotation,
                                       const EkDPlugIn& plugIn) {
  return annotations_->setAnnotation(annotation, plugIn);
}

void EkDatabase::beginAnnotationChanges() {
  annotations_->deferSaves();
}

Result<void> EkDatabase::commitAnnotationChanges() {
  return annotations_->saveDeferred();
}

void EkDatabase::notifyAnnotationChange() {
  platform_.notifier->post(protocol::kAnnotationChangeNotification);
}

void EkDatabase::autoElect(const EkDPlugIn& plugIn) {
  Dictionary annotation = annotations_->annotationForPlugIn(plugIn).value_or(Dictionary{});
  auto it = annotation.find(kElectionKey);
  if (it != annotation.end()) {
    auto value = EkDPlugIn::electionNumber(it->second);
    if (value && *value != 0) return;
  }
  annotation.insert_or_assign(std::string(kElectionKey), Value(uint64_t{1}));
  // The record is elected again when it is next built.
  if (Result<void> set = annotations_->setAnnotation(annotation, plugIn); !set.ok()) {
    log::ops().error("unable to auto-elect %{public}@: %{public}@", plugIn.annotationKey(),
                     set.error());
  }
}

void EkDatabase::pluginsDidInstall(const std::vector<vantor::PlugInProxyPtr>& plugIns) {
  for (const auto& proxy : plugIns) {
    log::ops().defaultLevel("plug-in INSTALLED:%@ %@(%@) %{public}@ %@", proxy->identifier,
                            proxy->identifier, proxy->bundleVersion.value_or("(null)"), proxy->uuid,
                            proxy->path);
  }
}

void EkDatabase::pluginsWillUninstall(const std::vector<vantor::PlugInProxyPtr>& plugIns) {
  for (const auto& proxy : plugIns) {
    log::ops().defaultLevel("plug-in UNINSTALLED:%@ %@(%@) %{public}@ %@", proxy->identifier,
                            proxy->identifier, proxy->bundleVersion.value_or("(null)"),
                            proxy->uuid.string(), proxy->path);
  }
  // The registry delivers on its own queue while the remover waits. A request that removed
  // the plug-ins runs there itself and drops their records at once; any other remover's
  // notice is queued behind the requests in flight, as if the removal had come a moment later.
  auto forget = [weak = weak_from_this(), plugIns] {
    auto self = weak.lock();
    if (!self) return;
    for (const auto& proxy : plugIns) self->cache_.erase(proxy->uuid);
  };
  if (owner_->isCurrent()) {
    forget();
  } else {
    owner_->async(std::move(forget));
  }
  if (delegate_) delegate_(plugIns);
}

}  // namespace ek
