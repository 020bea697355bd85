#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "ekd/EkDAnnotationStore.h"
#include "ekd/EkDFormCache.h"
#include "ekd/EkDPlugIn.h"
#include "platform/notify/Notifications.h"
#include "platform/queue/SerialQueue.h"
#include "platform/value/EkError.h"
#include "platform/value/Result.h"
#include "platform/value/Uuid.h"
#include "platform/value/Value.h"
#include "platform/vantor/Registry.h"

namespace ek {

using EkDPlugInRef = std::shared_ptr<EkDPlugIn>;

// Told when installed plug-ins are about to go away, on the registry's notice thread.
using EkDatabaseDelegate = std::function<void(const std::vector<vantor::PlugInProxyPtr>& plugIns)>;

// What the database needs from the platform.
struct EkDatabasePlatform {
  // Required.
  std::shared_ptr<vantor::Registry> registry;
  // The tokens added to forms; null means the process's sandbox.
  std::shared_ptr<EkSandbox> sandbox;
  // Empty means $EKORA_SYSTEM_ROOT.
  std::string systemRoot;
  // Required.
  std::shared_ptr<notify::Notifier> notifier;
  // Null means types::TypeSystem::system().
  std::shared_ptr<types::TypeSystem> types;
  // Where records declare their services for hosts and find running instances.
  std::shared_ptr<stard::ServiceManager> serviceManager;
  // Null means nothing is granted.
  std::shared_ptr<privo::Consent> consent;
};

// The daemon's view of the installed plug-ins: records built from the registry's proxies,
// cached by UUID, and the annotation store in front of which the cache sits. The cache keeps
// the records used most recently, up to its capacity: with a hundred thousand plug-ins, a
// record for each would take hundreds of megabytes, and building one again costs about as
// much as a find.
//
// The cache and the annotation store belong to one queue, the owner's (the daemon's work
// queue, on which every request runs): every operation runs there, enters no other queue and
// waits for nobody. Only the registry's notices arrive elsewhere; they hand their work to the
// owner's queue.
class EkDatabase : public vantor::RegistryObserver,
                   public std::enable_shared_from_this<EkDatabase> {
 public:
  EkDatabase() = default;
  ~EkDatabase() override;

  // Fails only when the annotation store cannot be opened. owner is the queue the database
  // runs on; none makes a queue "EkDatabase" of its own.
  bool initWithDatabase(std::optional<std::string> path, EkDatabasePlatform platform,
                        std::shared_ptr<SerialQueue> owner = nullptr);
  // The same with the annotation store opened already (EkDAnnotationStore::initWithDatabase).
  bool initWithStore(std::unique_ptr<EkDAnnotationStore> store, EkDatabasePlatform platform,
                     std::shared_ptr<SerialQueue> owner = nullptr);

  // The cached record of the proxy's UUID, else a new one. nullptr when the proxy yields no
  // record (the next request tries again).
  EkDPlugInRef plugInForProxy(const vantor::PlugInProxy& proxy);
  // Builds, auto-elects and caches a record.
  EkDPlugInRef createPlugInForProxy(const vantor::PlugInProxy& proxy);
  // Empties the whole cache when it holds more than limit records (compared unsigned, so a
  // negative limit never purges).
  void purgeCachesToLimit(int64_t limit);

  // Records of the plug-ins the registry selects for query, its "ZuUserElection" applied as
  // an election filter; each plug-in once, in the registry's order. Absent when the registry
  // answers nothing.
  std::optional<std::vector<EkDPlugInRef>> findPlugIns(const Dictionary& query);
  EkDPlugInRef findPlugIn(const Uuid& uuid);
  // A file URL (or absolute path) of a plug-in bundle.
  EkDPlugInRef findPlugInAtPath(std::string_view url);
  // Absent when the application is unknown or has no plug-ins.
  std::optional<std::vector<EkDPlugInRef>> plugInsWithinApplication(std::string_view appUrl);

  // Registers / unregisters a bundle with the registry: the Ekora error 2 when it refuses.
  // The cache follows through the registry's notices.
  std::optional<EkError> addPlugIn(std::string_view url);
  std::optional<EkError> removePlugIn(std::string_view url);

  std::optional<Dictionary> annotationForPlugIn(const EkDPlugIn& plugIn);
  // The annotation of each of plugIns as a reply carries it: a CBOR map, empty for none. All
  // of them are as the store held them at one moment, after every change made before the
  // call. Records keep what was read (EkDPlugIn::AnnotationNote), so while the store does not
  // change, this looks nothing up.
  using EncodedAnnotation = EkDPlugIn::EncodedAnnotation;
  std::vector<EncodedAnnotation> encodedAnnotationsForPlugIns(
      std::span<const EkDPlugIn* const> plugIns);
  // Merges (or, when absent, removes) and saves at once. Posts nothing: the request handlers
  // post once for all their changes with notifyAnnotationChange. A change that is refused or
  // cannot be saved is not kept (see EkDAnnotationStore::setAnnotation).
  Result<void> setAnnotation(const std::optional<Dictionary>& annotation, const EkDPlugIn& plugIn);
  void notifyAnnotationChange();
  // Annotation changes from beginAnnotationChanges() until commitAnnotationChanges() reach
  // memory at once and the file in one durable write at the commit. When that write fails,
  // every change since the beginning is undone and the error answered.
  void beginAnnotationChanges();
  Result<void> commitAnnotationChanges();

  // Elects a plug-in that holds the auto-elect entitlement unless a choice exists.
  void autoElect(const EkDPlugIn& plugIn);

  // Registry notices, on the registry's queue.
  void pluginsDidInstall(const std::vector<vantor::PlugInProxyPtr>& plugIns) override;
  void pluginsWillUninstall(const std::vector<vantor::PlugInProxyPtr>& plugIns) override;
  void localeDidChange() override;

  // Set before the registry's notices may arrive.
  void setDelegate(EkDatabaseDelegate delegate);
  uint32_t cacheLimit() const { return cacheLimit_.load(); }
  void setCacheLimit(uint32_t limit) { cacheLimit_ = limit; }
  // Records kept at most; the least recently used one goes to make room.
  static constexpr size_t kDefaultCacheCapacity = 4096;
  void setCacheCapacity(size_t capacity);
  size_t cacheCount() const;
  // Forms of the plug-ins that replies carry by the hundred ("match"), kept encoded.
  EkDFormCache& formCache() { return formCache_; }

  const std::shared_ptr<vantor::Registry>& workspace() const { return platform_.registry; }
  const std::shared_ptr<notify::Notifier>& notifier() const { return platform_.notifier; }
  // The owner's queue.
  const std::shared_ptr<SerialQueue>& databaseQueue() const { return owner_; }
  // The store itself, for tests and the daemon's own checks.
  EkDAnnotationStore& annotations() { return *annotations_; }

  // The election list of a query's "ZuUserElection": absent when there is none or a value
  // does not normalise (then no election filter applies).
  static std::optional<std::vector<std::string>> electionList(const Dictionary& query);
  // "=1" and "1" give "1"; an empty value or one starting with an operator gives nothing.
  static std::optional<std::string> normalizeElection(const Value& value);

 private:
  // Whether a candidate's election is one of elections.
  bool electionFilter(const std::vector<std::string>& elections, const std::string& identifier,
                      const Dictionary& entitlements);
  EkDPlugInContext recordContext();

  EkDatabaseDelegate delegate_;
  std::atomic<uint32_t> cacheLimit_{1000000};
  EkDatabasePlatform platform_;
  std::unique_ptr<EkDAnnotationStore> annotations_;
  std::shared_ptr<SerialQueue> owner_;
  // Records by UUID, most recently used first.
  class RecordCache {
   public:
    // The record of uuid, now the most recently used; nullptr when none is cached.
    EkDPlugInRef find(const Uuid& uuid);
    // Replaces the record of its UUID; the least recently used ones go beyond capacity.
    void insert(EkDPlugInRef record);
    void erase(const Uuid& uuid);
    void clear();
    size_t size() const { return index_.size(); }
    void setCapacity(size_t capacity);

   private:
    void evict();
    size_t capacity_ = kDefaultCacheCapacity;
    std::list<EkDPlugInRef> order_;
    std::unordered_map<Uuid, std::list<EkDPlugInRef>::iterator> index_;
  };
  RecordCache cache_;
  // About 2.6 KB a form: room for the 500 forms of a busy extension point and the plug-ins
  // found most recently. Finds pass every form they answer through it, so a larger cache
  // mostly holds forms nobody asks for again.
  EkDFormCache formCache_{2u << 20};
};

}  // namespace ek
