#pragma once

#include <sys/stat.h>

#include <chrono>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/codesign/CodeSigning.h"
#include "platform/io/FileStamp.h"
#include "platform/queue/SerialQueue.h"
#include "platform/vantor/BundleSources.h"
#include "platform/vantor/Registry.h"

struct sqlite3;

namespace ek::vantor {

// The registry kept in one SQLite database, $EKORA_STATE_DIR/registry.db.
//
// The daemon owns the file: it is opened in WAL mode with exclusive locking, so no second
// process (nor a second SqliteRegistry in this one) can open it while the daemon runs, and
// outside tools (sqlite3 on the command line) cannot read it then either. In exchange every
// statement is prepared once and kept, reads never take file locks, the WAL index lives in
// the process's memory instead of a -shm file, and the page cache is sized (32 MiB) to hold
// a registry of tens of thousands of plug-ins, so lookups do not touch the file at all.
//
// Opening checks the file (quick_check and the schema version); one that is not a database,
// fails the check or carries another schema version is renamed aside to
// registry.db.corrupt-<UTC timestamp> (with its -wal and -shm) and a fresh registry is built.
// A write-ahead log that SQLite would silently ignore in part or whole (a damaged header, or a
// broken checksum chain with later frames of the same log) is logged as an error and copied
// aside with the database under the same name before the database opens. Then the start-up
// scan runs (see reconcile), unless the owner runs it later (Options::scanOnOpen).
//
// The log is moved into the main file (a TRUNCATE checkpoint) once the registry has gone
// unchanged for Options::idleDelay and whenever checkpoint() is called, and free pages are
// then given back (incremental auto-vacuum; an older file is rebuilt with it once at opening).
class SqliteRegistry : public Registry, public std::enable_shared_from_this<SqliteRegistry> {
 public:
  struct Options {
    std::string databasePath;                  // default: <stateDir>/registry.db
    std::string stateDir;                      // default: ek::paths::stateDir()
    std::string systemRoot;                    // default: ek::paths::systemRoot()
    std::shared_ptr<CodeSigning> codeSigning;  // default: CodeSigning::system()
    std::shared_ptr<SerialQueue> queue;        // default: a new queue "com.corvane.vantor"
    // Told about everything the start-up scan installs and uninstalls.
    std::vector<std::weak_ptr<RegistryObserver>> observers;
    // False leaves the start-up scan to the owner (rescanSystemVolume), who may serve lookups
    // meanwhile: the daemon answers before it has read a large system volume.
    bool scanOnOpen = true;
    // How long a file must have been left alone before the scan trusts its stamp (see
    // BundleSources); tests shorten it.
    int64_t settleSeconds = BundleSources::kSettleSeconds;
    // How long the registry must go unchanged before its log is checkpointed.
    std::chrono::milliseconds idleDelay = std::chrono::seconds(10);
  };

  static Result<std::shared_ptr<SqliteRegistry>> open(Options options);
  ~SqliteRegistry() override;
  SqliteRegistry(const SqliteRegistry&) = delete;
  SqliteRegistry& operator=(const SqliteRegistry&) = delete;

  Result<void> registerBundle(const std::string& path) override;
  Result<void> unregisterBundle(const std::string& path) override;
  PlugInProxyPtr plugInByUuid(const Uuid& uuid) override;
  PlugInProxyPtr plugInByUrl(std::string_view urlOrPath) override;
  std::vector<PlugInProxyPtr> plugInsOfApplication(std::string_view appPath) override;
  std::vector<PlugInProxyPtr> installedPlugIns() override;
  ApplicationProxyPtr applicationByPath(std::string_view urlOrPath) override;
  ApplicationProxyPtr applicationByIdentifier(std::string_view identifier) override;
  std::vector<PlugInProxyPtr> query(const Dictionary& rules, const PlugInFilter& filter) override;
  std::vector<Uuid> queryUuids(const Dictionary& rules) override;
  size_t plugInCount() override;
  // This registry never makes placeholders.
  bool applicationIsPlaceholder(std::string_view) override { return false; }
  std::optional<Dictionary> extensionPointSdk(std::string_view identifier) override;
  Dictionary localizedStrings(const Uuid& plugIn, std::string_view table,
                              const std::vector<std::string>& keys) override;
  Uuid knowledgeUuid() override;
  void clearCaches() override;
  void checkpoint() override;
  SystemVolumeScan rescanSystemVolume() override { return reconcile(); }
  void addObserver(std::weak_ptr<RegistryObserver> observer) override;
  void removeObserver(const std::shared_ptr<RegistryObserver>& observer) override;

  // The start-up scan: registers every bundle under <systemRoot>/Library/PlugIns/ and
  // unregisters every plug-in and application whose bundle directory no longer exists.
  // A bundle that fails to register is logged and skipped. A bundle none of whose files
  // changed since it was last read (see BundleSources) is not read again. Bundles are
  // registered a batch per transaction, and changes from other threads wait for one batch at
  // most, not for the whole scan.
  SystemVolumeScan reconcile();

  // Compares the locale file with what was seen last and, when it changed, raises the
  // locale-change notice. Lookups do this on their own; exposed for callers that poll.
  void checkLocale();

  const std::string& databasePath() const { return options_.databasePath; }
  const std::shared_ptr<SerialQueue>& queue() const { return options_.queue; }

  struct Statements;
  struct Plan;

 private:
  explicit SqliteRegistry(Options options);
  Result<void> openDatabase();
  Result<void> prepareSchema();
  void closeDatabase();
  // Arms the idle checkpoint after a change.
  void noteChange();
  void armIdleTimer(std::chrono::nanoseconds after);
  void idleTimerFired();

  // Under changeMutex_.
  Result<void> applyPlan(Plan& plan);
  // Under changeMutex_: keeps the plan's plug-ins' records of sources, in one transaction.
  void recordSources(const Plan& plan);
  // REQUIRES: dbMutex_ held, inside a transaction. Rolls it back and answers the error.
  EkError rollback(std::string_view what);
  // REQUIRES: dbMutex_ held, inside a transaction. Changes the knowledge UUID and commits.
  Result<void> commitWithNewKnowledge();
  Result<void> unregisterLocked(const std::string& path);

  // Under dbMutex_. The language is the one checkLocale last saw.
  PlugInProxyPtr readPlugInLocked(void* statement);
  std::vector<PlugInProxyPtr> readAllLocked(void* statement);
  // The UUIDs query considers for rules, in path order.
  std::vector<Uuid> uuidsLocked(const Dictionary& rules);
  std::string languageLocked();

  void deliverInstall(std::vector<PlugInProxyPtr> plugIns);
  void deliverUninstall(const std::vector<PlugInProxyPtr>& plugIns);
  void deliverLocaleChange();
  std::vector<std::shared_ptr<RegistryObserver>> liveObservers();

  Options options_;
  // Serialises changes (register, unregister, each batch of the start-up scan), held across the
  // uninstall notice so that what the notice announces is what gets deleted.
  std::mutex changeMutex_;
  // Guards the connection and its statements.
  std::mutex dbMutex_;
  sqlite3* db_ = nullptr;
  std::unique_ptr<Statements> statements_;
  // Changed under dbMutex_ and knowledgeMutex_, read under either: records ask for it on
  // every use and must not wait for a transaction of the start-up scan.
  Uuid knowledge_;
  std::mutex knowledgeMutex_;
  void setKnowledge(const Uuid& knowledge);
  // uuidsLocked's answers for knowledge, by the index keys they read. REQUIRES dbMutex_.
  struct UuidLists {
    Uuid knowledge;
    std::unordered_map<std::string, std::vector<Uuid>> lists;
    size_t size = 0;  // UUIDs in all lists
  };
  static constexpr size_t kKeptUuidsLimit = 65536;
  UuidLists uuidLists_;

  struct IdleTimer;
  std::unique_ptr<IdleTimer> idle_;

  std::mutex observersMutex_;
  std::vector<std::weak_ptr<RegistryObserver>> observers_;

  std::mutex localeMutex_;
  bool localeSeen_ = false;
  std::optional<FileStamp> localeStamp_;     // nothing while the file is missing
  std::optional<std::string> fileLanguage_;  // the locale file's language as last seen
};

}  // namespace ek::vantor
