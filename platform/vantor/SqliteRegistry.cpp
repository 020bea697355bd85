#include "platform/vantor/SqliteRegistry.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <fmt/format.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <asio/steady_timer.hpp>

#include <algorithm>
#include <array>
#include <atomic>
#include <bit>
#include <chrono>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <future>
#include <map>
#include <set>
#include <system_error>
#include <thread>
#include <unordered_map>
#include <unordered_set>

#include "platform/cbor/Cbor.h"
#include "platform/dmap/Dmap.h"
#include "platform/io/UniqueFd.h"
#include "platform/log/Log.h"
#include "platform/paths/Directories.h"
#include "platform/vantor/BundleSources.h"

namespace ek::vantor {
namespace {

namespace fs = std::filesystem;

// Bumped whenever the tables change; a file with another version is set aside and rebuilt
// (the registry is derived data: the installer and the start-up scan can always refill it).
constexpr int kSchemaVersion = 4;
// Bounds on what one bundle may make the registry read.
constexpr size_t kMaxPlugInsPerApplication = 4096;
constexpr size_t kMaxLanguagesPerBundle = 512;
// The system volume is written by root only: this bounds the scan's memory (names and a
// chunk at a time), not what a client may ask for.
constexpr size_t kMaxSystemBundles = 1000000;
// Negative: KiB. The daemon keeps its own records of the plug-ins it was asked about, so a
// plug-in's pages are read about once: enough for the tree's inner pages, and the rest is left
// to the kernel's page cache rather than kept twice. With 10,000 plug-ins a 32 MB cache held
// 11 MB more once each had been looked up, for lookups of uncached records about 15 µs faster.
constexpr int kCacheSizeKiB = 2 * 1024;
constexpr int kCheckpointPages = 1000;  // SQLite's default
// While the start-up scan registers many bundles (see reconcile).
constexpr int kScanCacheSizeKiB = 16 * 1024;
constexpr int kScanCheckpointPages = 16384;

// What each plug-in was read from (BundleSources), apart from the plug-ins' rows so that the
// start-up scan reads only this.
#define SOURCES_SCHEMA                                                                         \
  "CREATE TABLE plugin_sources(path TEXT PRIMARY KEY, container TEXT, sources BLOB NOT NULL) " \
  "WITHOUT ROWID; "                                                                            \
  "CREATE TRIGGER plugins_forget_sources AFTER DELETE ON plugins BEGIN "                       \
  "DELETE FROM plugin_sources WHERE path = old.path; END;"

// Lets a query name its candidates in path order from an index alone, without reading the
// plug-ins' rows, which the daemon's records already hold.
#define UUID_PATH_SCHEMA "CREATE INDEX plugins_uuid_path ON plugins(uuid, path);"

// The bundle directory each plug-in was read from (BundleIdentity); NULL in rows written
// before it was kept.
#define IDENTITY_SCHEMA                             \
  "ALTER TABLE plugins ADD COLUMN device INTEGER; " \
  "ALTER TABLE plugins ADD COLUMN inode INTEGER; "  \
  "ALTER TABLE plugins ADD COLUMN real_path TEXT;"
// Rows without one are read again by the next scan, which records it. Rows whose info no
// bundle could give now (its Info.dmap and its SDK's, 1 MiB each, encode smaller than they
// read) were read before files were bounded: they are dropped, so a reply is not made of them.
#define IDENTITY_UPGRADE                                                      \
  IDENTITY_SCHEMA                                                             \
  " DELETE FROM plugin_sources;"                                              \
  " DELETE FROM plugin_points WHERE uuid IN (SELECT uuid FROM plugins WHERE " \
  "length(info) > 2097152);"                                                  \
  " DELETE FROM plugins WHERE length(info) > 2097152;"

constexpr const char* kSchema = R"sql(
CREATE TABLE meta(key TEXT PRIMARY KEY, value BLOB NOT NULL);
CREATE TABLE applications(
  path TEXT PRIMARY KEY,
  identifier TEXT NOT NULL,
  version TEXT,
  info BLOB NOT NULL,
  strings BLOB NOT NULL,
  registered REAL NOT NULL);
CREATE INDEX applications_identifier ON applications(identifier);
CREATE TABLE plugins(
  uuid BLOB PRIMARY KEY,
  path TEXT NOT NULL UNIQUE,
  identifier TEXT NOT NULL,
  original_identifier TEXT NOT NULL,
  version TEXT,
  app_path TEXT,
  point TEXT,
  info BLOB NOT NULL,
  sdk BLOB NOT NULL,
  entitlements BLOB NOT NULL,
  registered REAL NOT NULL,
  container TEXT,
  strings BLOB NOT NULL);
CREATE INDEX plugins_app ON plugins(app_path);
CREATE TABLE plugin_points(point TEXT NOT NULL, uuid BLOB NOT NULL, PRIMARY KEY(point, uuid))
  WITHOUT ROWID;
CREATE INDEX plugin_points_uuid ON plugin_points(uuid);
CREATE TABLE extension_points(identifier TEXT PRIMARY KEY, sdk BLOB NOT NULL);
)sql" SOURCES_SCHEMA " " UUID_PATH_SCHEMA " " IDENTITY_SCHEMA;

constexpr const char* kPlugInColumns =
    "p.uuid, p.path, p.identifier, p.original_identifier, p.version, p.app_path, p.point, "
    "p.info, p.sdk, p.entitlements, p.registered, p.container, p.strings, p.device, p.inode, "
    "p.real_path";

double now() {
  return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

std::vector<uint8_t> encodeDictionary(const Dictionary& dictionary) {
  return cbor::encode(Value(dictionary));
}

Dictionary decodeDictionary(const void* bytes, int size) {
  if (bytes == nullptr || size <= 0) return {};
  auto value = cbor::decode(
      std::span<const uint8_t>(static_cast<const uint8_t*>(bytes), static_cast<size_t>(size)));
  if (!value.ok() || value->dictionary() == nullptr) {
    log::vr().error("registry row holds an undecodable dictionary");
    return {};
  }
  return std::move(*value->dictionary());
}

std::string parentOf(const std::string& path) {
  size_t slash = path.rfind('/');
  if (slash == std::string::npos || slash == 0) return "/";
  return path.substr(0, slash);
}

std::string baseName(const std::string& path) {
  size_t slash = path.rfind('/');
  return slash == std::string::npos ? path : path.substr(slash + 1);
}

bool endsWith(std::string_view text, std::string_view suffix) {
  return text.size() >= suffix.size() && text.substr(text.size() - suffix.size()) == suffix;
}

bool isDirectory(const std::string& path) {
  struct stat st {};
  return ::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

// A bundle directory is gone only when the system says so; a transient failure to look
// (EACCES, EIO) must not unregister anything.
bool isGone(const std::string& path) {
  struct stat st {};
  if (::stat(path.c_str(), &st) == 0) return !S_ISDIR(st.st_mode);
  return errno == ENOENT || errno == ENOTDIR;
}

// Sorted names of the entries of the directory open as directoryFd (O_PATH will do) that are
// directories, at most limit of them. Read with getdents: every bundle's directory is listed
// for its strings tables, and the system volume's holds up to a million bundles.
std::vector<std::string> subdirectoriesAt(int directoryFd, std::string_view suffix, size_t limit,
                                          bool& truncated) {
  std::vector<std::string> names;
  truncated = false;
  UniqueFd listing(::openat(directoryFd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!listing.valid()) return names;
  alignas(struct dirent64) char buffer[16384];
  ssize_t got = 0;
  while (!truncated && (got = ::getdents64(listing.get(), buffer, sizeof buffer)) > 0) {
    for (ssize_t offset = 0; offset < got;) {
      const auto* entry = reinterpret_cast<const struct dirent64*>(buffer + offset);
      offset += entry->d_reclen;
      std::string_view name = entry->d_name;
      if (name.empty() || name.front() == '.') continue;
      if (!suffix.empty() && !endsWith(name, suffix)) continue;
      // The entry's type from the directory itself where it has one (a symlink is followed).
      bool directory = entry->d_type == DT_DIR;
      if (entry->d_type == DT_UNKNOWN || entry->d_type == DT_LNK) {
        struct stat st {};
        directory = ::fstatat(listing.get(), entry->d_name, &st, 0) == 0 && S_ISDIR(st.st_mode);
      }
      if (!directory) continue;
      if (names.size() == limit) {
        truncated = true;
        break;
      }
      names.emplace_back(name);
    }
  }
  std::sort(names.begin(), names.end());
  return names;
}

std::vector<std::string> subdirectories(const std::string& dir, std::string_view suffix,
                                        size_t limit, bool& truncated) {
  truncated = false;
  UniqueFd directory(::open(dir.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!directory.valid()) return {};
  return subdirectoriesAt(directory.get(), suffix, limit, truncated);
}

// A bundle's Info.dmap, read beneath its directory; with identity, the directory it was read
// from, and with directoryOut, that directory kept open so that the bundle's other files are
// read from the same one. With sources, notes the files read (see BundleSources) before
// reading them.
Result<Dictionary> readInfo(const std::string& bundle, BundleSources* sources = nullptr,
                            std::optional<BundleIdentity>* identity = nullptr,
                            UniqueFd* directoryOut = nullptr) {
  if (sources) {
    sources->note(bundle);
    sources->note(paths::join(bundle, "Info.dmap"));
  }
  UniqueFd directory(::open(bundle.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!directory.valid()) {
    return makeError(kMalformedBundle, fmt::format("{} is not a bundle directory", bundle));
  }
  if (identity) {
    *identity = bundleIdentityOf(directory.get(), bundle);
    if (!*identity) {
      return makeError(kMalformedBundle,
                       fmt::format("{}: the directory changed while it was read", bundle));
    }
  }
  auto value = dmap::readFileBeneath(directory.get(), bundle, "Info.dmap");
  if (!value.ok()) {
    return makeError(kMalformedBundle,
                     fmt::format("{}: unreadable Info.dmap: {}", bundle, value.error().message));
  }
  if (value->dictionary() == nullptr) {
    return makeError(kMalformedBundle,
                     fmt::format("{}: Info.dmap does not hold a dictionary", bundle));
  }
  if (directoryOut) *directoryOut = std::move(directory);
  return std::move(*value->dictionary());
}

// Every <language>.lproj/InfoDmap.strings of the bundle: language -> table. A malformed table
// is logged and left out; it does not make the bundle malformed.
// directoryFd, when given, is the bundle directory open.
Dictionary readInfoStrings(const std::string& bundle, BundleSources* sources = nullptr,
                           int directoryFd = -1) {
  Dictionary tables;
  bool truncated = false;
  const std::vector<std::string> languages =
      directoryFd >= 0 ? subdirectoriesAt(directoryFd, ".lproj", kMaxLanguagesPerBundle, truncated)
                       : subdirectories(bundle, ".lproj", kMaxLanguagesPerBundle, truncated);
  for (const std::string& dir : languages) {
    const std::string relative = paths::join(dir, "InfoDmap.strings");
    std::string file = paths::join(bundle, relative);
    if (sources) {
      // The directory too: a table created in it later changes the directory's stamp.
      sources->note(paths::join(bundle, dir));
      sources->note(file);
    }
    auto value = directoryFd >= 0 ? dmap::readFileBeneath(directoryFd, bundle, relative)
                                  : dmap::readFileBeneath(bundle, relative);
    if (!value.ok()) {
      if (!value.error().isPosix(ENOENT)) {
        log::vr().error("ignoring strings table %s: %s", file, value.error().message);
      }
      continue;
    }
    if (value->dictionary() == nullptr) {
      log::vr().error("ignoring strings table %s: not a dictionary", file);
      continue;
    }
    tables.emplace(dir.substr(0, dir.size() - std::string_view(".lproj").size()),
                   std::move(*value));
  }
  if (truncated)
    log::vr().error("%s: more than %u languages; the rest ignored", bundle,
                    static_cast<unsigned>(kMaxLanguagesPerBundle));
  return tables;
}

std::optional<std::string> stringValue(const Dictionary& dictionary, std::string_view key) {
  auto it = dictionary.find(key);
  if (it == dictionary.end() || it->second.string() == nullptr) return std::nullopt;
  return *it->second.string();
}

// A localized value: the strings table of the first language that has one, then the info
// dictionary itself.
std::optional<std::string> localized(const Dictionary& info, const Dictionary& tables,
                                     const std::vector<std::string>& languages,
                                     std::initializer_list<std::string_view> keys) {
  for (const std::string& language : languages) {
    auto table = tables.find(language);
    if (table == tables.end() || table->second.dictionary() == nullptr) continue;
    for (std::string_view key : keys) {
      if (auto text = stringValue(*table->second.dictionary(), key)) return text;
    }
  }
  for (std::string_view key : keys) {
    if (auto text = stringValue(info, key)) return text;
  }
  return std::nullopt;
}

std::optional<std::string> localizedName(const Dictionary& info, const Dictionary& tables,
                                         const std::vector<std::string>& languages) {
  return localized(info, tables, languages, {kBundleDisplayNameKey, kBundleNameKey});
}

std::string utcStamp() {
  std::time_t t = std::time(nullptr);
  std::tm tm{};
  gmtime_r(&t, &tm);
  char text[32];
  std::strftime(text, sizeof text, "%Y%m%dT%H%M%SZ", &tm);
  return text;
}

}  // namespace

struct AppPlan {
  std::string path;
  std::string identifier;
  std::optional<std::string> version;
  Dictionary info;
  Dictionary strings;
};

struct PlugInPlan {
  std::string path;
  std::string identifier;
  std::optional<std::string> version;
  std::optional<std::string> appPath;
  std::optional<std::string> point;
  Dictionary info;  // merged
  Dictionary sdk;
  Dictionary entitlements;
  std::optional<std::string> container;
  Dictionary strings;
  std::optional<std::vector<uint8_t>> sources;  // see BundleSources
  std::optional<BundleIdentity> identity;
};

struct SqliteRegistry::Plan {
  std::vector<AppPlan> apps;
  std::vector<PlugInPlan> plugIns;
  bool containersMade = false;  // the plug-ins' data containers exist already
  // An application being (re-)registered: its registered plug-ins missing from plugIns go.
  std::optional<std::string> replacesPlugInsOf;
};

// Prepared once, kept for the life of the connection.
struct SqliteRegistry::Statements {
  sqlite3_stmt* begin = nullptr;
  sqlite3_stmt* commit = nullptr;
  sqlite3_stmt* rollback = nullptr;
  sqlite3_stmt* setMeta = nullptr;
  sqlite3_stmt* getMeta = nullptr;
  sqlite3_stmt* upsertApp = nullptr;
  sqlite3_stmt* deleteApp = nullptr;
  sqlite3_stmt* appByPath = nullptr;
  sqlite3_stmt* appByIdentifier = nullptr;
  sqlite3_stmt* appExists = nullptr;
  sqlite3_stmt* allApps = nullptr;
  sqlite3_stmt* insertPlugIn = nullptr;
  sqlite3_stmt* deletePlugIn = nullptr;
  sqlite3_stmt* insertPoint = nullptr;
  sqlite3_stmt* deletePoints = nullptr;
  sqlite3_stmt* plugInByUuid = nullptr;
  sqlite3_stmt* plugInByPath = nullptr;
  sqlite3_stmt* plugInsOfApp = nullptr;
  sqlite3_stmt* plugInUuidsOfApp = nullptr;
  sqlite3_stmt* allPlugIns = nullptr;
  sqlite3_stmt* allPlugInUuids = nullptr;
  sqlite3_stmt* plugInUuidsOfPoint = nullptr;
  sqlite3_stmt* upsertSdk = nullptr;
  sqlite3_stmt* sdkOf = nullptr;
  sqlite3_stmt* setSources = nullptr;
  sqlite3_stmt* forgetSources = nullptr;
  sqlite3_stmt* sourcesBetween = nullptr;
  sqlite3_stmt* allPlugInPaths = nullptr;
  sqlite3_stmt* countPlugIns = nullptr;

  std::vector<sqlite3_stmt**> all() {
    return {&begin,
            &commit,
            &rollback,
            &setMeta,
            &getMeta,
            &upsertApp,
            &deleteApp,
            &appByPath,
            &appByIdentifier,
            &appExists,
            &allApps,
            &insertPlugIn,
            &deletePlugIn,
            &insertPoint,
            &deletePoints,
            &plugInByUuid,
            &plugInByPath,
            &plugInsOfApp,
            &plugInUuidsOfApp,
            &allPlugIns,
            &allPlugInUuids,
            &plugInUuidsOfPoint,
            &upsertSdk,
            &sdkOf,
            &setSources,
            &sourcesBetween,
            &allPlugInPaths,
            &countPlugIns,
            &forgetSources};
  }
  ~Statements() {
    for (sqlite3_stmt** statement : all()) sqlite3_finalize(*statement);
  }
};

namespace {

// Resets a kept statement when a scope using it ends, whatever the path out.
class Use {
 public:
  explicit Use(sqlite3_stmt* statement) : statement_(statement) {}
  ~Use() {
    sqlite3_reset(statement_);
    sqlite3_clear_bindings(statement_);
  }
  Use(const Use&) = delete;
  Use& operator=(const Use&) = delete;

  Use& text(int index, std::string_view value) {
    sqlite3_bind_text(statement_, index, value.data(), static_cast<int>(value.size()),
                      SQLITE_TRANSIENT);
    return *this;
  }
  Use& optionalText(int index, const std::optional<std::string>& value) {
    if (value) return text(index, *value);
    sqlite3_bind_null(statement_, index);
    return *this;
  }
  Use& blob(int index, const void* bytes, size_t size) {
    sqlite3_bind_blob(statement_, index, bytes, static_cast<int>(size), SQLITE_TRANSIENT);
    return *this;
  }
  Use& blob(int index, const std::vector<uint8_t>& bytes) {
    return blob(index, bytes.data(), bytes.size());
  }
  Use& uuid(int index, const Uuid& uuid) { return blob(index, uuid.bytes.data(), 16); }
  Use& integer(int index, uint64_t value) {
    sqlite3_bind_int64(statement_, index, static_cast<sqlite3_int64>(value));
    return *this;
  }
  Use& identity(int index, const std::optional<BundleIdentity>& value) {
    if (!value) {
      for (int i = 0; i < 3; ++i) sqlite3_bind_null(statement_, index + i);
      return *this;
    }
    return integer(index, value->device)
        .integer(index + 1, value->inode)
        .text(index + 2, value->canonicalPath);
  }
  Use& real(int index, double value) {
    sqlite3_bind_double(statement_, index, value);
    return *this;
  }
  int step() { return sqlite3_step(statement_); }
  sqlite3_stmt* get() const { return statement_; }

 private:
  sqlite3_stmt* statement_;
};

std::optional<std::string> columnText(sqlite3_stmt* statement, int column) {
  if (sqlite3_column_type(statement, column) == SQLITE_NULL) return std::nullopt;
  const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(statement, column));
  return std::string(text, static_cast<size_t>(sqlite3_column_bytes(statement, column)));
}

Dictionary columnDictionary(sqlite3_stmt* statement, int column) {
  const void* bytes = sqlite3_column_blob(statement, column);
  return decodeDictionary(bytes, sqlite3_column_bytes(statement, column));
}

std::optional<BundleIdentity> columnIdentity(sqlite3_stmt* statement, int column) {
  for (int i = 0; i < 3; ++i) {
    if (sqlite3_column_type(statement, column + i) == SQLITE_NULL) return std::nullopt;
  }
  return BundleIdentity{static_cast<uint64_t>(sqlite3_column_int64(statement, column)),
                        static_cast<uint64_t>(sqlite3_column_int64(statement, column + 1)),
                        columnText(statement, column + 2).value_or("")};
}

Uuid columnUuid(sqlite3_stmt* statement, int column) {
  Uuid uuid;
  if (sqlite3_column_bytes(statement, column) == 16) {
    uuid = Uuid::fromBytes(static_cast<const uint8_t*>(sqlite3_column_blob(statement, column)));
  }
  return uuid;
}

}  // namespace

// ---------------------------------------------------------------------------------------------
// Opening

SqliteRegistry::SqliteRegistry(Options options) : options_(std::move(options)) {}

// The idle checkpoint: a timer armed by the first change after a checkpoint, which waits until
// the registry has gone unchanged for the idle delay.
struct SqliteRegistry::IdleTimer {
  using Clock = std::chrono::steady_clock;
  explicit IdleTimer(asio::io_context& context) : timer(context) {}
  std::mutex mutex;  // guards timer
  asio::steady_timer timer;
  std::atomic<Clock::rep> lastChange{0};
  std::atomic<bool> armed{false};
};

SqliteRegistry::~SqliteRegistry() {
  if (idle_) {
    std::lock_guard lock(idle_->mutex);
    idle_->timer.cancel();
  }
  // Notices already posted run before the registry goes, so an observer that looks back into
  // the registry from a notice never finds it half destroyed.
  if (options_.queue && !options_.queue->isCurrent()) options_.queue->sync([] {});
  closeDatabase();
}

namespace {

// SQLite's own reports: damage and failed I/O loudly, recovery notices as they come, the rest
// (every failing statement passes through here too) only when asked for.
void forwardSqliteLog(void*, int code, const char* message) {
  switch (code & 0xff) {
    case SQLITE_CORRUPT:
    case SQLITE_NOTADB:
    case SQLITE_IOERR:
    case SQLITE_CANTOPEN:
    case SQLITE_FULL:
      log::vr().error("SQLite: %s (%s)", message, sqlite3_errstr(code));
      break;
    case SQLITE_NOTICE:
      log::vr().defaultLevel("SQLite: %s", message);
      break;
    default:
      log::vr().debug("SQLite: %s (%s)", message, sqlite3_errstr(code));
  }
}

}  // namespace

Result<std::shared_ptr<SqliteRegistry>> SqliteRegistry::open(Options options) {
  // Only before SQLite's first use; later (another user of SQLite in the process) it is
  // refused, and SQLite stays quiet as before.
  static std::once_flag logging;
  std::call_once(logging, [] { sqlite3_config(SQLITE_CONFIG_LOG, forwardSqliteLog, nullptr); });
  if (options.stateDir.empty()) options.stateDir = paths::stateDir();
  if (options.systemRoot.empty()) options.systemRoot = paths::systemRoot();
  if (options.databasePath.empty()) {
    options.databasePath = paths::join(options.stateDir, "registry.db");
  }
  if (!options.codeSigning) options.codeSigning = CodeSigning::system();
  if (!options.queue) options.queue = SerialQueue::make("com.corvane.vantor");
  std::shared_ptr<SqliteRegistry> registry(new SqliteRegistry(std::move(options)));
  registry->observers_ = registry->options_.observers;
  registry->idle_ = std::make_unique<IdleTimer>(QueuePool::shared().context());
  EK_TRY(registry->openDatabase());
  registry->checkLocale();
  if (registry->options_.scanOnOpen) registry->reconcile();
  return registry;
}

void SqliteRegistry::closeDatabase() {
  uuidLists_ = {};
  statements_.reset();
  if (db_ != nullptr) sqlite3_close_v2(db_);
  db_ = nullptr;
}

namespace {

enum class OpenOutcome { Ok, Corrupt, Failed };

struct OpenResult {
  OpenOutcome outcome = OpenOutcome::Ok;
  EkError error;
};

bool isCorruption(int rc) {
  int primary = rc & 0xff;
  return primary == SQLITE_NOTADB || primary == SQLITE_CORRUPT || primary == SQLITE_CANTOPEN ||
         primary == SQLITE_PERM || primary == SQLITE_AUTH || primary == SQLITE_READONLY;
}

OpenResult failure(sqlite3* db, int rc, std::string_view what) {
  std::string message = fmt::format("{}: {}", what, db ? sqlite3_errmsg(db) : sqlite3_errstr(rc));
  int primary = rc & 0xff;
  if (primary == SQLITE_BUSY || primary == SQLITE_LOCKED) {
    return {OpenOutcome::Failed,
            makeError(kInUse, fmt::format("registry database is in use: {}", message))};
  }
  if (isCorruption(rc)) return {OpenOutcome::Corrupt, makeError(kDatabase, message)};
  return {OpenOutcome::Failed, makeError(kDatabase, message)};
}

// Runs a statement that may answer rows; answers the first column of the first row.
int execute(sqlite3* db, const char* sql, std::string* firstValue = nullptr) {
  sqlite3_stmt* statement = nullptr;
  int rc = sqlite3_prepare_v2(db, sql, -1, &statement, nullptr);
  if (rc != SQLITE_OK) return rc;
  bool first = true;
  while ((rc = sqlite3_step(statement)) == SQLITE_ROW) {
    if (first && firstValue != nullptr) {
      const unsigned char* text = sqlite3_column_text(statement, 0);
      *firstValue = text ? reinterpret_cast<const char*>(text) : "";
    }
    first = false;
  }
  sqlite3_finalize(statement);
  return rc == SQLITE_DONE ? SQLITE_OK : rc;
}

OpenResult openAndCheck(const std::string& path, sqlite3** out) {
  sqlite3* db = nullptr;
  int rc = sqlite3_open_v2(
      path.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX, nullptr);
  *out = db;
  if (rc != SQLITE_OK) return failure(db, rc, "opening the registry database");
  sqlite3_extended_result_codes(db, 1);
  // Exclusive locking before WAL is first used: the WAL index then lives in this process's
  // memory and the lock is never given back until the connection closes.
  if ((rc = execute(db, "PRAGMA locking_mode=EXCLUSIVE")) != SQLITE_OK) {
    return failure(db, rc, "setting exclusive locking");
  }
  std::string mode;
  if ((rc = execute(db, "PRAGMA journal_mode=WAL", &mode)) != SQLITE_OK) {
    return failure(db, rc, "setting WAL mode");
  }
  if (mode != "wal") {
    return {OpenOutcome::Failed, makeError(kDatabase, "the registry database refused WAL mode")};
  }
  // Take the lock now, so that a second opener fails at once rather than on its first write.
  if ((rc = execute(db, "BEGIN EXCLUSIVE")) != SQLITE_OK) {
    return failure(db, rc, "locking the registry database");
  }
  execute(db, "COMMIT");
  std::string check;
  if ((rc = execute(db, "PRAGMA quick_check", &check)) != SQLITE_OK) {
    return failure(db, rc, "checking the registry database");
  }
  if (check != "ok") {
    return {OpenOutcome::Corrupt, makeError(kDatabase, fmt::format("quick_check: {}", check))};
  }
  std::string version;
  if ((rc = execute(db, "PRAGMA user_version", &version)) != SQLITE_OK) {
    return failure(db, rc, "reading the schema version");
  }
  std::string tables;
  if ((rc = execute(db, "SELECT count(*) FROM sqlite_master", &tables)) != SQLITE_OK) {
    return failure(db, rc, "reading the schema");
  }
  if (version == "0" && tables == "0") {
    std::string create =
        fmt::format("BEGIN; {} PRAGMA user_version={}; COMMIT;", kSchema, kSchemaVersion);
    if ((rc = sqlite3_exec(db, create.c_str(), nullptr, nullptr, nullptr)) != SQLITE_OK) {
      OpenResult result = failure(db, rc, "creating the registry schema");
      execute(db, "ROLLBACK");
      return result;
    }
  } else if (version == "1" || version == "2" || version == "3") {
    // Version 1 lacked the record of each plug-in's sources (without one, the next scan reads
    // the bundle and records it), versions 1 and 2 the index of paths by UUID, versions 1 to 3
    // the bundle directories (their plug-ins get no rights until registered again; the next
    // scan does that for the system's).
    const char* upgrade = version == "1" ? "BEGIN; " SOURCES_SCHEMA " " UUID_PATH_SCHEMA
                                           " " IDENTITY_UPGRADE " PRAGMA user_version=4; COMMIT;"
                          : version == "2" ? "BEGIN; " UUID_PATH_SCHEMA " " IDENTITY_UPGRADE
                                             " PRAGMA user_version=4; COMMIT;"
                                           : "BEGIN; " IDENTITY_UPGRADE
                                             " PRAGMA user_version=4; COMMIT;";
    if ((rc = sqlite3_exec(db, upgrade, nullptr, nullptr, nullptr)) != SQLITE_OK) {
      OpenResult result = failure(db, rc, "upgrading the registry schema");
      execute(db, "ROLLBACK");
      return result;
    }
  } else if (version != std::to_string(kSchemaVersion)) {
    return {OpenOutcome::Corrupt,
            makeError(kDatabase,
                      fmt::format("schema version {} (expected {})", version, kSchemaVersion))};
  }
  // Free pages go back to the file system (at each checkpoint); a file made before that is
  // rebuilt once, since only a VACUUM changes the setting of a file that has tables.
  std::string autoVacuum;
  if ((rc = execute(db, "PRAGMA auto_vacuum", &autoVacuum)) != SQLITE_OK) {
    return failure(db, rc, "reading the vacuum mode");
  }
  if (autoVacuum != "2") {
    if ((rc = execute(db, "PRAGMA auto_vacuum=INCREMENTAL")) != SQLITE_OK ||
        (rc = execute(db, "VACUUM")) != SQLITE_OK) {
      log::vr().error("registry database %s: cannot turn on incremental vacuum: %s", path,
                      sqlite3_errmsg(db));
    }
  }
  if ((rc = execute(db, fmt::format("PRAGMA cache_size=-{}", kCacheSizeKiB).c_str())) !=
          SQLITE_OK ||
      (rc = execute(db, "PRAGMA synchronous=FULL")) != SQLITE_OK ||
      // After a checkpoint the log is cut back to this, rather than keeping the size of the
      // largest change ever made (a first registration of thousands of bundles).
      (rc = execute(db, "PRAGMA journal_size_limit=8388608")) != SQLITE_OK) {
    return failure(db, rc, "configuring the registry database");
  }
  return {};
}

// The write-ahead log's layout (SQLite's file format): a 32-byte header, then frames of a
// 24-byte header and one page each. Numbers are big-endian; the checksums run over 32-bit words
// in the order the magic number's low bit names.
constexpr size_t kWalHeaderSize = 32;
constexpr size_t kWalFrameHeaderSize = 24;
constexpr uint32_t kWalMagic = 0x377f0682;
constexpr uint32_t kWalVersion = 3007000;

uint32_t bigEndian32(const uint8_t* bytes) {
  return uint32_t{bytes[0]} << 24 | uint32_t{bytes[1]} << 16 | uint32_t{bytes[2]} << 8 | bytes[3];
}

void walChecksum(bool bigEndianWords, const uint8_t* bytes, size_t size,
                 std::array<uint32_t, 2>& sum) {
  for (size_t i = 0; i + 8 <= size; i += 8) {
    uint32_t first, second;
    if (bigEndianWords) {
      first = bigEndian32(bytes + i);
      second = bigEndian32(bytes + i + 4);
    } else {
      std::memcpy(&first, bytes + i, 4);
      std::memcpy(&second, bytes + i + 4, 4);
      if constexpr (std::endian::native == std::endian::big) {
        first = __builtin_bswap32(first);
        second = __builtin_bswap32(second);
      }
    }
    sum[0] += first + sum[1];
    sum[1] += second + sum[0];
  }
}

// Why SQLite would leave out changes committed to the write-ahead log at path, or nothing when
// it would not: a log whose header is damaged is ignored whole, and one whose checksum chain
// breaks is ignored from there on, which loses data when later frames belong to the same log
// (frames of an earlier log, left behind by a restart, carry other salts and are harmless).
std::optional<std::string> walDamage(const std::string& path) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
  if (fd.get() < 0) return std::nullopt;
  struct stat status {};
  if (::fstat(fd.get(), &status) != 0 || !S_ISREG(status.st_mode)) return std::nullopt;
  const auto size = static_cast<uint64_t>(status.st_size);
  // Nothing was ever committed to a log without a frame.
  if (size < kWalHeaderSize + kWalFrameHeaderSize) return std::nullopt;
  uint8_t header[kWalHeaderSize];
  if (::pread(fd.get(), header, sizeof header, 0) != static_cast<ssize_t>(sizeof header)) {
    return fmt::format("cannot read its header: {}", std::strerror(errno));
  }
  const uint32_t magic = bigEndian32(header);
  if ((magic & ~uint32_t{1}) != kWalMagic) return "its header has no write-ahead log magic number";
  const bool bigEndianWords = (magic & 1) != 0;
  if (bigEndian32(header + 4) != kWalVersion) return "its header names an unknown format version";
  const uint32_t pageSize = bigEndian32(header + 8);
  if (pageSize < 512 || pageSize > 65536 || (pageSize & (pageSize - 1)) != 0) {
    return "its header names an impossible page size";
  }
  std::array<uint32_t, 2> sum{0, 0};
  walChecksum(bigEndianWords, header, 24, sum);
  if (sum[0] != bigEndian32(header + 24) || sum[1] != bigEndian32(header + 28)) {
    return "its header checksum does not match";
  }
  const size_t frameSize = kWalFrameHeaderSize + pageSize;
  std::vector<uint8_t> frame(frameSize);
  bool broken = false;
  uint64_t number = 0;
  for (uint64_t offset = kWalHeaderSize; offset + frameSize <= size; offset += frameSize) {
    ++number;
    if (::pread(fd.get(), frame.data(), frameSize, static_cast<off_t>(offset)) !=
        static_cast<ssize_t>(frameSize)) {
      return fmt::format("cannot read frame {}: {}", number, std::strerror(errno));
    }
    const bool sameLog = std::memcmp(frame.data() + 8, header + 16, 8) == 0;
    if (broken) {
      if (sameLog)
        return fmt::format("its checksums break before frame {} of the same log", number);
      continue;
    }
    std::array<uint32_t, 2> next = sum;
    walChecksum(bigEndianWords, frame.data(), 8, next);
    walChecksum(bigEndianWords, frame.data() + kWalFrameHeaderSize, pageSize, next);
    if (sameLog && bigEndian32(frame.data()) != 0 && next[0] == bigEndian32(frame.data() + 16) &&
        next[1] == bigEndian32(frame.data() + 20)) {
      sum = next;
      continue;
    }
    broken = true;
  }
  return std::nullopt;
}

}  // namespace

Result<void> SqliteRegistry::openDatabase() {
  const std::string& path = options_.databasePath;
  EK_TRY(paths::ensureDirectory(parentOf(path)));
  // SQLite would open the database without a word and lose what the log held: say so, and keep
  // both files for a person before the first write replaces the log.
  const std::string wal = path + "-wal";
  if (std::optional<std::string> damage = walDamage(wal)) {
    std::string aside = fmt::format("{}.corrupt-{}", path, utcStamp());
    for (int n = 1; access(aside.c_str(), F_OK) == 0; ++n) {
      aside = fmt::format("{}.corrupt-{}-{}", path, utcStamp(), n);
    }
    std::error_code copyError;
    std::filesystem::copy_file(path, aside, copyError);
    if (!copyError) std::filesystem::copy_file(wal, aside + "-wal", copyError);
    if (copyError) {
      log::vr().error(
          "registry write-ahead log %s is unusable (%s); changes it held are lost, "
          "and it could not be kept aside: %s",
          wal, *damage, copyError.message());
    } else {
      log::vr().error(
          "registry write-ahead log %s is unusable (%s); changes it held are lost; "
          "kept aside with its database as %s",
          wal, *damage, aside);
    }
  }
  for (int attempt = 0; attempt < 2; ++attempt) {
    sqlite3* db = nullptr;
    OpenResult result = openAndCheck(path, &db);
    if (result.outcome == OpenOutcome::Ok) {
      db_ = db;
      break;
    }
    if (result.outcome == OpenOutcome::Failed || attempt == 1) {
      sqlite3_close_v2(db);
      return result.error;
    }
    // Renamed while still open: closing may delete the -wal file, which belongs to the
    // evidence being kept.
    std::string aside = fmt::format("{}.corrupt-{}", path, utcStamp());
    for (int n = 1; access(aside.c_str(), F_OK) == 0; ++n) {
      aside = fmt::format("{}.corrupt-{}-{}", path, utcStamp(), n);
    }
    log::vr().error("registry database %s is unusable (%s); moved aside to %s, rebuilding", path,
                    result.error.message, aside);
    if (::rename(path.c_str(), aside.c_str()) != 0 && errno != ENOENT) {
      int error = errno;
      sqlite3_close_v2(db);
      return EkError::fromErrno(error, fmt::format("moving {} aside", path));
    }
    // Kept beside the main file under the names SQLite looks for, so the copy stays readable.
    for (const char* suffix : {"-wal", "-shm"}) {
      std::string from = path + suffix;
      std::string to = aside + suffix;
      if (::rename(from.c_str(), to.c_str()) != 0 && errno != ENOENT) {
        log::vr().error("could not move %s aside: %{errno}d", from, errno);
        ::unlink(from.c_str());
      }
    }
    sqlite3_close_v2(db);
  }
  return prepareSchema();
}

Result<void> SqliteRegistry::prepareSchema() {
  statements_ = std::make_unique<Statements>();
  Statements& s = *statements_;
  const std::string plugInSelect = fmt::format("SELECT {} FROM plugins p ", kPlugInColumns);
  const std::pair<sqlite3_stmt**, std::string> sql[] = {
      {&s.begin, "BEGIN IMMEDIATE"},
      {&s.commit, "COMMIT"},
      {&s.rollback, "ROLLBACK"},
      {&s.setMeta, "INSERT OR REPLACE INTO meta(key, value) VALUES(?1, ?2)"},
      {&s.getMeta, "SELECT value FROM meta WHERE key = ?1"},
      {&s.upsertApp,
       "INSERT OR REPLACE INTO applications(path, identifier, version, info, strings, "
       "registered) VALUES(?1, ?2, ?3, ?4, ?5, ?6)"},
      {&s.deleteApp, "DELETE FROM applications WHERE path = ?1"},
      {&s.appByPath,
       "SELECT path, identifier, version, info, strings, registered FROM applications "
       "WHERE path = ?1"},
      {&s.appByIdentifier,
       "SELECT path, identifier, version, info, strings, registered FROM applications "
       "WHERE identifier = ?1 ORDER BY path LIMIT 1"},
      {&s.appExists, "SELECT 1 FROM applications WHERE path = ?1"},
      {&s.allApps, "SELECT path FROM applications ORDER BY path"},
      {&s.insertPlugIn,
       "INSERT INTO plugins(uuid, path, identifier, original_identifier, version, app_path, "
       "point, info, sdk, entitlements, registered, container, strings, device, inode, "
       "real_path) VALUES(?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8, ?9, ?10, ?11, ?12, ?13, ?14, ?15, ?16)"},
      {&s.setSources,
       "INSERT OR REPLACE INTO plugin_sources(path, container, sources) VALUES(?1, ?2, ?3)"},
      {&s.forgetSources, "DELETE FROM plugin_sources WHERE path = ?1"},
      // Joined: a record is only good for a plug-in still registered at its path.
      {&s.sourcesBetween,
       "SELECT s.path, s.container, s.sources FROM plugin_sources s "
       "JOIN plugins p ON p.path = s.path WHERE s.path BETWEEN ?1 AND ?2"},
      {&s.allPlugInPaths, "SELECT path FROM plugins ORDER BY path"},
      {&s.countPlugIns, "SELECT count(*) FROM plugins"},
      {&s.deletePlugIn, "DELETE FROM plugins WHERE uuid = ?1"},
      {&s.insertPoint, "INSERT OR IGNORE INTO plugin_points(point, uuid) VALUES(?1, ?2)"},
      {&s.deletePoints, "DELETE FROM plugin_points WHERE uuid = ?1"},
      {&s.plugInByUuid, plugInSelect + "WHERE p.uuid = ?1"},
      {&s.plugInByPath, plugInSelect + "WHERE p.path = ?1"},
      {&s.plugInsOfApp, plugInSelect + "WHERE p.app_path = ?1 ORDER BY p.path"},
      {&s.plugInUuidsOfApp, "SELECT uuid FROM plugins WHERE app_path = ?1 ORDER BY path"},
      {&s.allPlugIns, plugInSelect + "ORDER BY p.path"},
      {&s.allPlugInUuids, "SELECT uuid FROM plugins ORDER BY path"},
      {&s.plugInUuidsOfPoint,
       "SELECT p.uuid FROM plugin_points pp JOIN plugins p INDEXED BY plugins_uuid_path "
       "ON p.uuid = pp.uuid WHERE pp.point = ?1 ORDER BY p.path"},
      {&s.upsertSdk, "INSERT OR REPLACE INTO extension_points(identifier, sdk) VALUES(?1, ?2)"},
      {&s.sdkOf, "SELECT sdk FROM extension_points WHERE identifier = ?1"},
  };
  for (const auto& [statement, text] : sql) {
    int rc =
        sqlite3_prepare_v3(db_, text.c_str(), -1, SQLITE_PREPARE_PERSISTENT, statement, nullptr);
    if (rc != SQLITE_OK) {
      return makeError(kDatabase, fmt::format("preparing \"{}\": {}", text, sqlite3_errmsg(db_)));
    }
  }
  {
    Use get(s.getMeta);
    get.text(1, "knowledge");
    if (get.step() == SQLITE_ROW && sqlite3_column_bytes(get.get(), 0) == 16) {
      setKnowledge(columnUuid(get.get(), 0));
      return {};
    }
  }
  setKnowledge(Uuid::random());
  Use set(s.setMeta);
  set.text(1, "knowledge").uuid(2, knowledge_);
  if (set.step() != SQLITE_DONE) {
    return makeError(kDatabase, fmt::format("storing the knowledge UUID: {}", sqlite3_errmsg(db_)));
  }
  return {};
}

// ---------------------------------------------------------------------------------------------
// Reading bundles into a plan (no lock held: only files are read)

namespace {

struct BundleReader {
  const SqliteRegistry::Options& options;
  // The SDK dictionaries read so far, by extension point, with the stamp their file had: a
  // scan reads thousands of bundles of a few extension points.
  struct KnownSdk {
    FileStamp stamp;
    Dictionary sdk;
  };
  std::unordered_map<std::string, KnownSdk> sdks = {};
  std::string context = {};

  Result<AppPlan> readApplication(const std::string& path) {
    Dictionary info = EK_TRY(readInfo(path));
    auto identifier = stringValue(info, kBundleIdentifierKey);
    if (!identifier) {
      return makeError(kMalformedBundle,
                       fmt::format("{}: Info.dmap has no QvBundleIdentifier string", path));
    }
    AppPlan plan;
    plan.path = path;
    plan.identifier = *identifier;
    plan.version = stringValue(info, kBundleVersionKey);
    plan.strings = readInfoStrings(path);
    plan.info = std::move(info);
    return plan;
  }

  std::optional<Dictionary> readSdk(const std::string& point, BundleSources* sources) {
    if (!checkPlugInIdentifier(point).ok()) {
      log::vr().error("extension point \"%s\" cannot name an SDK file", point);
      return std::nullopt;
    }
    const std::string directory = paths::join(options.systemRoot, "Library/ExtensionPoints");
    std::string file = paths::join(directory, point + ".dmap");
    if (sources) sources->noteShared(file);
    // Kept only once its file has been left alone for a while: a file changed twice within one
    // tick of the file system's clock would keep its stamp.
    struct stat status {};
    std::optional<FileStamp> stamp;
    if (::stat(file.c_str(), &status) == 0 && S_ISREG(status.st_mode) &&
        ::time(nullptr) - std::max(status.st_mtim.tv_sec, status.st_ctim.tv_sec) >
            std::max<int64_t>(options.settleSeconds, 1)) {
      stamp = FileStamp::of(status);
      if (auto known = sdks.find(point); known != sdks.end() && known->second.stamp == *stamp) {
        return known->second.sdk;
      }
    }
    auto value = dmap::readFileBeneath(directory, point + ".dmap");
    if (!value.ok()) {
      if (value.error().isPosix(ENOENT)) {
        log::vr().info("plug-in sdk \"%s\" not registered", point);
      } else {
        log::vr().error("unreadable SDK dictionary %s: %s", file, value.error().message);
      }
      return std::nullopt;
    }
    if (value->dictionary() == nullptr) {
      log::vr().error("SDK dictionary %s does not hold a dictionary", file);
      return std::nullopt;
    }
    if (stamp) sdks.insert_or_assign(point, KnownSdk{*stamp, *value->dictionary()});
    return std::move(*value->dictionary());
  }

  // What reading a bundle depends on besides its files.
  const std::string& sourcesContext() {
    // The last field names the way bundles are read: records made by an older one say
    // nothing of what this one would read.
    if (context.empty()) {
      context =
          fmt::format("{}\n{}\n{}\nbeneath-1", options.stateDir, options.systemRoot, ::geteuid());
    }
    return context;
  }

  Result<PlugInPlan> readPlugIn(const std::string& path) {
    BundleSources sources(sourcesContext(), options.settleSeconds);
    std::optional<BundleIdentity> identity;
    UniqueFd directory;
    Dictionary own = EK_TRY(readInfo(path, &sources, &identity, &directory));
    auto identifier = stringValue(own, kBundleIdentifierKey);
    if (!identifier) {
      return makeError(kMalformedBundle,
                       fmt::format("{}: Info.dmap has no QvBundleIdentifier string", path));
    }
    EK_TRY(checkPlugInIdentifier(*identifier));
    auto extension = own.find(kExtensionKey);
    if (extension == own.end() || extension->second.dictionary() == nullptr) {
      return makeError(kMalformedBundle,
                       fmt::format("{}: Info.dmap has no ZuExtension dictionary", path));
    }
    PlugInPlan plan;
    plan.path = path;
    plan.identity = std::move(identity);
    plan.identifier = *identifier;
    plan.version = stringValue(own, kBundleVersionKey);
    if (const Value* point = extension->second.get(kExtensionPointKey)) {
      if (point->string() == nullptr) {
        return makeError(kMalformedBundle,
                         fmt::format("{}: ZuExtensionPointIdentifier is not a string", path));
      }
      plan.point = *point->string();
    }
    if (auto executable = own.find(kBundleExecutableKey); executable != own.end()) {
      const std::string* name = executable->second.string();
      if (name == nullptr || name->empty() || *name == "." || *name == ".." ||
          name->find('/') != std::string::npos || name->find('\0') != std::string::npos) {
        return makeError(kMalformedBundle,
                         fmt::format("{}: QvBundleExecutable is not a file name", path));
      }
      std::string program = paths::join(path, *name);
      if (auto files = options.codeSigning->entitlementSources(program)) {
        for (const std::string& file : *files) sources.note(file);
      } else {
        sources.markUncheckable();
      }
      plan.entitlements = options.codeSigning->entitlementsForExecutable(program);
    }
    if (plan.point) {
      if (auto sdk = readSdk(*plan.point, &sources)) plan.sdk = std::move(*sdk);
    }
    plan.info = mergeSdk(plan.sdk, own);
    Dictionary* merged = plan.info[std::string(kExtensionKey)].dictionary();
    if (plan.point) {
      auto attributes = merged->find(kExtensionAttributesKey);
      if (attributes != merged->end() && attributes->second.dictionary() != nullptr) {
        attributes->second.dictionary()->try_emplace(std::string(kExtensionPointKey), *plan.point);
      }
    }
    const Value* protocol = nullptr;
    if (auto it = merged->find(kExtensionProtocolKey); it != merged->end()) protocol = &it->second;
    bool dataOnly = protocol != nullptr && protocol->string() != nullptr &&
                    *protocol->string() == kDataProtocol;
    if (!dataOnly) {
      plan.container = paths::join(paths::join(options.stateDir, "containers"), plan.identifier);
    }
    plan.strings = readInfoStrings(path, &sources, directory.get());
    // The entitlements were read by path: a bundle swapped for a link meanwhile could have
    // given them from elsewhere. The path must still name the directory read.
    struct stat named {};
    if (!plan.identity || ::stat(path.c_str(), &named) != 0 ||
        static_cast<uint64_t>(named.st_dev) != plan.identity->device ||
        static_cast<uint64_t>(named.st_ino) != plan.identity->inode) {
      return makeError(kMalformedBundle,
                       fmt::format("{}: the directory changed while it was read", path));
    }
    plan.sources = sources.record();
    std::string parent = parentOf(path);
    if (baseName(parent) == "PlugIns" && endsWith(parentOf(parent), ".app")) {
      plan.appPath = parentOf(parent);
    }
    return plan;
  }
};

}  // namespace

Result<void> SqliteRegistry::registerBundle(const std::string& rawPath) {
  auto path = pathFromUrlOrPath(rawPath);
  if (!path) {
    return makeError(kMalformedBundle, fmt::format("\"{}\" is not an absolute path", rawPath));
  }
  std::lock_guard change(changeMutex_);
  // The reason a bundle is refused is the registry's own: the daemon answers its client
  // without it.
  Result<void> registered = [&]() -> Result<void> {
    BundleReader reader{options_};
    Plan plan;
    if (endsWith(*path, ".app")) {
      plan.apps.push_back(EK_TRY(reader.readApplication(*path)));
      bool truncated = false;
      std::string plugIns = paths::join(*path, "PlugIns");
      auto names = subdirectories(plugIns, ".appex", kMaxPlugInsPerApplication, truncated);
      if (truncated) {
        return makeError(kMalformedBundle, fmt::format("{}: more than {} plug-ins", *path,
                                                       kMaxPlugInsPerApplication));
      }
      for (const std::string& name : names) {
        PlugInPlan plugIn = EK_TRY(reader.readPlugIn(paths::join(plugIns, name)));
        plan.plugIns.push_back(std::move(plugIn));
      }
      plan.replacesPlugInsOf = *path;
    } else {
      PlugInPlan plugIn = EK_TRY(reader.readPlugIn(*path));
      if (plugIn.appPath) {
        bool known = false;
        {
          std::lock_guard db(dbMutex_);
          Use exists(statements_->appExists);
          exists.text(1, *plugIn.appPath);
          known = exists.step() == SQLITE_ROW;
        }
        if (!known) plan.apps.push_back(EK_TRY(reader.readApplication(*plugIn.appPath)));
      }
      plan.plugIns.push_back(std::move(plugIn));
    }
    return applyPlan(plan);
  }();
  if (!registered.ok()) {
    log::vr().defaultLevel("not registering %s: %s", *path, registered.error().message);
  }
  return registered;
}

EkError SqliteRegistry::rollback(std::string_view what) {
  EkError error = makeError(kDatabase, fmt::format("{}: {}", what, sqlite3_errmsg(db_)));
  Use(statements_->rollback).step();
  return error;
}

Result<void> SqliteRegistry::commitWithNewKnowledge() {
  Statements& s = *statements_;
  Uuid knowledge = Uuid::random();
  {
    Use meta(s.setMeta);
    meta.text(1, "knowledge").uuid(2, knowledge);
    if (meta.step() != SQLITE_DONE) return rollback("changing the knowledge UUID");
  }
  if (Use(s.commit).step() != SQLITE_DONE) return rollback("committing a change");
  setKnowledge(knowledge);
  noteChange();
  return {};
}

void SqliteRegistry::noteChange() {
  if (!idle_) return;
  idle_->lastChange.store(IdleTimer::Clock::now().time_since_epoch().count());
  if (!idle_->armed.exchange(true)) armIdleTimer(options_.idleDelay);
}

void SqliteRegistry::armIdleTimer(std::chrono::nanoseconds after) {
  std::lock_guard lock(idle_->mutex);
  idle_->timer.expires_after(after);
  idle_->timer.async_wait([weak = weak_from_this()](const asio::error_code& error) {
    if (error) return;
    if (auto self = weak.lock()) self->idleTimerFired();
  });
}

void SqliteRegistry::idleTimerFired() {
  const auto seen = idle_->lastChange.load();
  const auto quiet = IdleTimer::Clock::now().time_since_epoch() - IdleTimer::Clock::duration(seen);
  if (quiet < options_.idleDelay) {
    armIdleTimer(options_.idleDelay - quiet);
    return;
  }
  idle_->armed.store(false);
  checkpoint();
  // A change between the reading of the clock and the clearing of armed saw the timer armed
  // and left it alone: take it on here.
  if (idle_->lastChange.load() != seen && !idle_->armed.exchange(true)) {
    armIdleTimer(options_.idleDelay);
  }
}

void SqliteRegistry::checkpoint() {
  std::lock_guard db(dbMutex_);
  if (db_ == nullptr) return;
  const std::string& path = options_.databasePath;
  // Freed pages first, so that the checkpoint carries their removal into the file.
  if (execute(db_, "PRAGMA incremental_vacuum") != SQLITE_OK) {
    log::vr().error("registry database %s: cannot give free pages back: %s", path,
                    sqlite3_errmsg(db_));
  }
  int logged = 0, moved = 0;
  if (sqlite3_wal_checkpoint_v2(db_, nullptr, SQLITE_CHECKPOINT_TRUNCATE, &logged, &moved) !=
      SQLITE_OK) {
    log::vr().error("registry database %s: cannot checkpoint its write-ahead log: %s", path,
                    sqlite3_errmsg(db_));
  }
}

namespace {

Result<void> makeContainer(const PlugInPlan& plugIn) {
  if (!plugIn.container) return {};
  EK_TRY(paths::ensureDirectory(*plugIn.container));
  return paths::ensureDirectory(paths::join(*plugIn.container, "tmp"));
}

}  // namespace

Result<void> SqliteRegistry::applyPlan(Plan& plan) {
  // Containers first: they outlive registrations anyway, and a failure here leaves the
  // registry untouched.
  if (!plan.containersMade) {
    for (const PlugInPlan& plugIn : plan.plugIns) EK_TRY(makeContainer(plugIn));
  }

  std::vector<Uuid> uuids;
  std::vector<PlugInProxyPtr> leaving;
  {
    std::lock_guard db(dbMutex_);
    std::set<std::string> planned;
    for (const PlugInPlan& plugIn : plan.plugIns) {
      planned.insert(plugIn.path);
      Use find(statements_->plugInByPath);
      find.text(1, plugIn.path);
      PlugInProxyPtr existing = find.step() == SQLITE_ROW ? readPlugInLocked(find.get()) : nullptr;
      if (existing && existing->identifier == plugIn.identifier) {
        uuids.push_back(existing->uuid);
      } else {
        uuids.push_back(Uuid::random());
        if (existing) leaving.push_back(existing);
      }
    }
    if (plan.replacesPlugInsOf) {
      Use list(statements_->plugInsOfApp);
      list.text(1, *plan.replacesPlugInsOf);
      for (PlugInProxyPtr& old : readAllLocked(list.get())) {
        if (!planned.contains(old->path)) leaving.push_back(std::move(old));
      }
    }
  }

  deliverUninstall(leaving);

  std::vector<PlugInProxyPtr> installed;
  {
    std::lock_guard db(dbMutex_);
    Statements& s = *statements_;
    auto fail = [&](std::string_view what) { return rollback(what); };
    if (Use(s.begin).step() != SQLITE_DONE) {
      return makeError(kDatabase, fmt::format("beginning a change: {}", sqlite3_errmsg(db_)));
    }
    double registered = now();
    for (const AppPlan& app : plan.apps) {
      Use upsert(s.upsertApp);
      upsert.text(1, app.path)
          .text(2, app.identifier)
          .optionalText(3, app.version)
          .blob(4, encodeDictionary(app.info))
          .blob(5, encodeDictionary(app.strings))
          .real(6, registered);
      if (upsert.step() != SQLITE_DONE) return fail("registering an application");
    }
    for (const PlugInProxyPtr& old : leaving) {
      Use points(s.deletePoints);
      points.uuid(1, old->uuid);
      Use remove(s.deletePlugIn);
      remove.uuid(1, old->uuid);
      if (points.step() != SQLITE_DONE || remove.step() != SQLITE_DONE) {
        return fail("unregistering a replaced plug-in");
      }
    }
    for (size_t i = 0; i < plan.plugIns.size(); ++i) {
      const PlugInPlan& plugIn = plan.plugIns[i];
      const Uuid& uuid = uuids[i];
      {
        Use points(s.deletePoints);
        points.uuid(1, uuid);
        Use remove(s.deletePlugIn);
        remove.uuid(1, uuid);
        if (points.step() != SQLITE_DONE || remove.step() != SQLITE_DONE) {
          return fail("replacing a plug-in");
        }
      }
      Use insert(s.insertPlugIn);
      insert.uuid(1, uuid)
          .text(2, plugIn.path)
          .text(3, plugIn.identifier)
          .text(4, plugIn.identifier)
          .optionalText(5, plugIn.version)
          .optionalText(6, plugIn.appPath)
          .optionalText(7, plugIn.point)
          .blob(8, encodeDictionary(plugIn.info))
          .blob(9, encodeDictionary(plugIn.sdk))
          .blob(10, encodeDictionary(plugIn.entitlements))
          .real(11, registered)
          .optionalText(12, plugIn.container)
          .blob(13, encodeDictionary(plugIn.strings))
          .identity(14, plugIn.identity);
      if (insert.step() != SQLITE_DONE) return fail("registering a plug-in");
      if (plugIn.sources) {
        Use record(s.setSources);
        record.text(1, plugIn.path).optionalText(2, plugIn.container).blob(3, *plugIn.sources);
        if (record.step() != SQLITE_DONE) return fail("recording a plug-in's sources");
      } else {
        Use forget(s.forgetSources);
        forget.text(1, plugIn.path);
        if (forget.step() != SQLITE_DONE) return fail("recording a plug-in's sources");
      }
      for (const std::string& value : extensionPointIndexValues(plugIn.info)) {
        Use point(s.insertPoint);
        point.text(1, extensionPointIndexKey(value)).uuid(2, uuid);
        if (point.step() != SQLITE_DONE) return fail("indexing a plug-in");
      }
      if (plugIn.point && !plugIn.sdk.empty()) {
        Use sdk(s.upsertSdk);
        sdk.text(1, *plugIn.point).blob(2, encodeDictionary(plugIn.sdk));
        if (sdk.step() != SQLITE_DONE) return fail("recording an extension point");
      }
    }
    EK_TRY(commitWithNewKnowledge());
    for (const Uuid& uuid : uuids) {
      Use find(s.plugInByUuid);
      find.uuid(1, uuid);
      if (find.step() == SQLITE_ROW) installed.push_back(readPlugInLocked(find.get()));
    }
  }
  if (log::vr().enabled(log::Level::Info)) {
    for (const PlugInProxyPtr& plugIn : installed) {
      log::vr().info("registered %s", plugIn->description());
    }
  }
  deliverInstall(std::move(installed));
  return {};
}

Result<void> SqliteRegistry::unregisterBundle(const std::string& rawPath) {
  auto path = pathFromUrlOrPath(rawPath);
  if (!path) {
    return makeError(kNotRegistered, fmt::format("\"{}\" is not an absolute path", rawPath));
  }
  std::lock_guard change(changeMutex_);
  return unregisterLocked(*path);
}

Result<void> SqliteRegistry::unregisterLocked(const std::string& path) {
  std::vector<PlugInProxyPtr> leaving;
  bool isApplication = false;
  {
    std::lock_guard db(dbMutex_);
    Use find(statements_->plugInByPath);
    find.text(1, path);
    if (find.step() == SQLITE_ROW) {
      leaving.push_back(readPlugInLocked(find.get()));
    } else {
      Use exists(statements_->appExists);
      exists.text(1, path);
      if (exists.step() != SQLITE_ROW) {
        return makeError(kNotRegistered, fmt::format("no bundle is registered at {}", path));
      }
      isApplication = true;
      Use list(statements_->plugInsOfApp);
      list.text(1, path);
      leaving = readAllLocked(list.get());
    }
  }

  deliverUninstall(leaving);

  std::lock_guard db(dbMutex_);
  Statements& s = *statements_;
  auto fail = [&](std::string_view what) { return rollback(what); };
  if (Use(s.begin).step() != SQLITE_DONE) {
    return makeError(kDatabase, fmt::format("beginning a change: {}", sqlite3_errmsg(db_)));
  }
  for (const PlugInProxyPtr& old : leaving) {
    Use points(s.deletePoints);
    points.uuid(1, old->uuid);
    Use remove(s.deletePlugIn);
    remove.uuid(1, old->uuid);
    if (points.step() != SQLITE_DONE || remove.step() != SQLITE_DONE) {
      return fail("unregistering a plug-in");
    }
  }
  if (isApplication) {
    Use remove(s.deleteApp);
    remove.text(1, path);
    if (remove.step() != SQLITE_DONE) return fail("unregistering an application");
  }
  EK_TRY(commitWithNewKnowledge());
  log::vr().info("unregistered %s (%u plug-ins)", path, static_cast<unsigned>(leaving.size()));
  return {};
}

// Records are only an optimisation: a failure to keep them costs the next scan time, nothing
// else, and changes nothing anyone can see (no knowledge change, no notices).
void SqliteRegistry::recordSources(const Plan& plan) {
  std::lock_guard db(dbMutex_);
  Statements& s = *statements_;
  if (Use(s.begin).step() != SQLITE_DONE) {
    log::vr().error("cannot record plug-ins' sources: %s", sqlite3_errmsg(db_));
    return;
  }
  for (const PlugInPlan& plugIn : plan.plugIns) {
    if (!plugIn.sources) continue;
    Use record(s.setSources);
    record.text(1, plugIn.path).optionalText(2, plugIn.container).blob(3, *plugIn.sources);
    if (record.step() != SQLITE_DONE) {
      log::vr().error("cannot record the sources of %s: %s", plugIn.path, sqlite3_errmsg(db_));
      Use(s.rollback).step();
      return;
    }
  }
  if (Use(s.commit).step() != SQLITE_DONE) {
    log::vr().error("cannot record plug-ins' sources: %s", sqlite3_errmsg(db_));
    Use(s.rollback).step();
  }
}

namespace {

// The start-up check of the system bundles' records uses up to this many threads, one for
// every so many bundles.
constexpr size_t kMaxCheckThreads = 4;
constexpr size_t kBundlesPerCheckThread = 512;
// The scan checks records a chunk of bundles at a time, and registers bundles a batch per
// transaction: one commit (one sync of the log to disk) a batch rather than a bundle, while
// lookups from other threads wait for one batch at most.
constexpr size_t kScanChunk = 4096;
constexpr size_t kScanBatch = 512;

// A data container outlives registrations, but someone may have removed it.
void ensureContainer(const std::string& container, const std::string& bundle) {
  std::string tmp = paths::join(container, "tmp");
  if (isDirectory(tmp)) return;
  if (auto made = paths::ensureDirectory(tmp); !made.ok()) {
    log::vr().error("cannot make the data container of %s: %s", bundle, made.error().message);
  }
}

}  // namespace

Registry::SystemVolumeScan SqliteRegistry::reconcile() {
  BundleReader reader{options_};
  const std::string dir = paths::join(options_.systemRoot, "Library/PlugIns");
  bool truncated = false;
  const std::vector<std::string> names = subdirectories(dir, "", kMaxSystemBundles, truncated);
  auto pathOf = [&](size_t i) { return paths::join(dir, names[i]); };
  SystemVolumeScan scan;
  scan.bundles = names.size();

  // Registering thousands of bundles inserts into indexes keyed by random UUIDs: with the
  // usual cache their pages were read back for nearly every bundle, and the log was moved into
  // the file at nearly every commit. For a large scan both are larger, then back.
  const bool large = names.size() > kScanBatch;
  auto tune = [&](int cacheKiB, int checkpointPages) {
    std::lock_guard db(dbMutex_);
    execute(db_, fmt::format("PRAGMA cache_size=-{}", cacheKiB).c_str());
    execute(db_, fmt::format("PRAGMA wal_autocheckpoint={}", checkpointPages).c_str());
  };
  if (large) tune(kScanCacheSizeKiB, kScanCheckpointPages);

  // Bundles read again and found registered as they read: only their new records of sources
  // are kept, so that the next scan need not read them.
  Plan fresh;
  // Bundles to register, a transaction each batch. A batch's data containers are made on a
  // helper thread while this one reads the next batch: two new directories per plug-in were a
  // third of a first registration.
  Plan batch;
  Plan prepared;  // the batch whose containers are being made
  std::future<std::vector<Result<void>>> making;
  auto makeContainers = [](const Plan* plan) {
    std::vector<Result<void>> made;
    made.reserve(plan->plugIns.size());
    for (const PlugInPlan& plugIn : plan->plugIns) made.push_back(makeContainer(plugIn));
    return made;
  };
  auto registerPrepared = [&] {
    if (!making.valid()) return;
    std::vector<Result<void>> made = making.get();
    Plan ready;
    ready.containersMade = true;
    for (size_t i = 0; i < prepared.plugIns.size(); ++i) {
      if (made[i].ok()) {
        ready.plugIns.push_back(std::move(prepared.plugIns[i]));
      } else {
        log::vr().error("not registering system plug-in %s: %s", prepared.plugIns[i].path,
                        made[i].error().message);
      }
    }
    prepared = {};
    if (ready.plugIns.empty()) return;
    std::lock_guard change(changeMutex_);
    if (applyPlan(ready).ok()) return;
    // One bundle that cannot be registered keeps none of the others out.
    for (PlugInPlan& plugIn : ready.plugIns) {
      Plan one;
      one.containersMade = true;
      one.plugIns.push_back(std::move(plugIn));
      if (auto applied = applyPlan(one); !applied.ok()) {
        log::vr().error("not registering system plug-in %s: %s", one.plugIns[0].path,
                        applied.error().message);
      }
    }
  };
  auto registerBatch = [&] {
    registerPrepared();
    if (batch.plugIns.empty()) return;
    prepared = std::move(batch);
    batch = {};
    try {
      making = std::async(std::launch::async, makeContainers, &prepared);
    } catch (const std::system_error&) {
      making = std::async(std::launch::deferred, makeContainers, &prepared);  // no thread
    }
  };
  auto recordFresh = [&] {
    if (fresh.plugIns.empty()) return;
    std::lock_guard change(changeMutex_);
    recordSources(fresh);
    fresh = {};
  };

  // A chunk of bundles at a time, so that what the scan holds stays bounded however many
  // bundles there are.
  const std::string context = reader.sourcesContext();
  for (size_t first = 0; first < names.size(); first += kScanChunk) {
    const size_t end = std::min(names.size(), first + kScanChunk);
    // What each plug-in of the chunk was last read from: a bundle whose sources all stat as
    // recorded reads the same as it did, so it is left alone without opening a file. Paths
    // sort as the names do, so the chunk's records are one range of the table.
    struct Recorded {
      std::optional<std::string> container;
      std::vector<uint8_t> sources;
    };
    std::unordered_map<std::string, Recorded> recorded;
    {
      std::lock_guard db(dbMutex_);
      Use list(statements_->sourcesBetween);
      list.text(1, pathOf(first)).text(2, pathOf(end - 1));
      while (list.step() == SQLITE_ROW) {
        sqlite3_stmt* row = list.get();
        auto path = columnText(row, 0);
        if (!path) continue;
        const auto* bytes = static_cast<const uint8_t*>(sqlite3_column_blob(row, 2));
        int size = sqlite3_column_bytes(row, 2);
        recorded.emplace(std::move(*path),
                         Recorded{columnText(row, 1), std::vector<uint8_t>(bytes, bytes + size)});
      }
    }

    // Which records still hold. Checking them only reads the records and stats files, and
    // with many system bundles it is most of a scan, so it is shared among a few threads.
    std::vector<char> holds(end - first, 0);
    auto check = [&](size_t begin, size_t stop) {
      BundleSources::Checker checker(context);
      for (size_t i = begin; i < stop; ++i) {
        const std::string path = pathOf(first + i);
        auto known = recorded.find(path);
        if (known == recorded.end() || !checker.unchanged(known->second.sources)) continue;
        if (known->second.container) ensureContainer(*known->second.container, path);
        holds[i] = 1;
      }
    };
    const size_t count = end - first;
    const size_t threads = std::clamp<size_t>(
        std::min<size_t>(std::thread::hardware_concurrency(), count / kBundlesPerCheckThread), 1,
        kMaxCheckThreads);
    {
      std::vector<std::thread> helpers;
      const size_t share = (count + threads - 1) / threads;
      for (size_t t = 1; t < threads; ++t) {
        const size_t begin = std::min(count, t * share);
        const size_t stop = std::min(count, (t + 1) * share);
        try {
          helpers.emplace_back(check, begin, stop);
        } catch (const std::system_error&) {
          check(begin, stop);  // no thread to be had: this one does that share too
        }
      }
      check(0, std::min(count, share));
      for (std::thread& helper : helpers) helper.join();
    }

    for (size_t i = 0; i < count; ++i) {
      if (holds[i]) {
        ++scan.unchanged;
        continue;
      }
      const std::string path = pathOf(first + i);
      ++scan.read;
      auto plugIn = reader.readPlugIn(path);
      if (!plugIn.ok()) {
        log::vr().error("not registering system plug-in %s: %s", path, plugIn.error().message);
        continue;
      }
      // A bundle registered exactly as it reads now is left alone: re-registering it would
      // cost a commit, a knowledge change and notices.
      bool unchanged = false;
      {
        std::lock_guard db(dbMutex_);
        Use find(statements_->plugInByPath);
        find.text(1, plugIn->path);
        if (find.step() == SQLITE_ROW) {
          sqlite3_stmt* row = find.get();
          unchanged =
              columnText(row, 2) == plugIn->identifier && columnText(row, 4) == plugIn->version &&
              columnText(row, 5) == plugIn->appPath && columnText(row, 6) == plugIn->point &&
              columnText(row, 11) == plugIn->container &&
              columnDictionary(row, 7) == plugIn->info && columnDictionary(row, 8) == plugIn->sdk &&
              columnDictionary(row, 9) == plugIn->entitlements &&
              columnDictionary(row, 12) == plugIn->strings &&
              columnIdentity(row, 13) == plugIn->identity;
        }
      }
      if (unchanged) {
        if (plugIn->container) ensureContainer(*plugIn->container, path);
        if (plugIn->sources) fresh.plugIns.push_back(std::move(plugIn).value());
        if (fresh.plugIns.size() == kScanBatch) recordFresh();
        continue;
      }
      batch.plugIns.push_back(std::move(plugIn).value());
      if (batch.plugIns.size() == kScanBatch) registerBatch();
    }
  }
  registerBatch();
  registerPrepared();
  recordFresh();
  if (large) tune(kCacheSizeKiB, kCheckpointPages);
  if (truncated) {
    log::vr().error("%s: more than %zu bundles; the rest ignored", dir, kMaxSystemBundles);
  }
  log::vr().info("%zu system bundles: %zu unchanged since they were last read, %zu read",
                 scan.bundles, scan.unchanged, scan.read);

  // Registered plug-ins and applications whose bundles are gone. Names are sorted, so a
  // system bundle's presence is a binary search.
  std::vector<std::string> registered;
  {
    std::lock_guard db(dbMutex_);
    Use list(statements_->allPlugInPaths);
    while (list.step() == SQLITE_ROW) {
      if (auto path = columnText(list.get(), 0)) registered.push_back(std::move(*path));
    }
    Use apps(statements_->allApps);
    while (apps.step() == SQLITE_ROW) {
      if (auto path = columnText(apps.get(), 0)) registered.push_back(std::move(*path));
    }
  }
  const std::string prefix = dir + "/";
  auto present = [&](const std::string& path) {
    if (!path.starts_with(prefix)) return false;
    std::string_view name = std::string_view(path).substr(prefix.size());
    return std::binary_search(names.begin(), names.end(), name,
                              [](std::string_view a, std::string_view b) { return a < b; });
  };
  for (const std::string& path : registered) {
    if (present(path) || !isGone(path)) continue;
    std::lock_guard change(changeMutex_);
    if (auto removed = unregisterLocked(path);
        !removed.ok() && removed.error().code != kNotRegistered) {
      log::vr().error("could not unregister vanished bundle %s: %s", path, removed.error().message);
    }
  }
  return scan;
}

// ---------------------------------------------------------------------------------------------
// Lookups

PlugInProxyPtr SqliteRegistry::readPlugInLocked(void* raw) {
  auto* statement = static_cast<sqlite3_stmt*>(raw);
  auto proxy = std::make_shared<PlugInProxy>();
  proxy->uuid = columnUuid(statement, 0);
  proxy->path = columnText(statement, 1).value_or("");
  proxy->url = fileUrlForPath(proxy->path);
  proxy->identifier = columnText(statement, 2).value_or("");
  proxy->originalIdentifier = columnText(statement, 3).value_or(proxy->identifier);
  proxy->bundleVersion = columnText(statement, 4);
  proxy->containingAppPath = columnText(statement, 5);
  proxy->extensionPoint = columnText(statement, 6);
  proxy->info = columnDictionary(statement, 7);
  proxy->sdk = columnDictionary(statement, 8);
  proxy->entitlements = columnDictionary(statement, 9);
  proxy->registrationDate = Date{sqlite3_column_double(statement, 10)};
  proxy->dataContainerPath = columnText(statement, 11);
  proxy->bundleIdentity = columnIdentity(statement, 13);
  proxy->knowledge = knowledge_;
  Dictionary strings = columnDictionary(statement, 12);
  std::vector<std::string> languages = languageCandidates(languageLocked());
  proxy->localizedName = localizedName(proxy->info, strings, languages);
  proxy->localizedShortName = localized(proxy->info, strings, languages, {kBundleNameKey});
  const std::string& root = options_.systemRoot;
  proxy->onSystemVolume = proxy->path.size() > root.size() &&
                          proxy->path.compare(0, root.size(), root) == 0 &&
                          proxy->path[root.size()] == '/';
  if (proxy->containingAppPath) {
    Use app(statements_->appByPath);
    app.text(1, *proxy->containingAppPath);
    if (app.step() == SQLITE_ROW) {
      proxy->containingAppName =
          localizedName(columnDictionary(app.get(), 3), columnDictionary(app.get(), 4), languages);
    }
  }
  return proxy;
}

std::vector<PlugInProxyPtr> SqliteRegistry::readAllLocked(void* raw) {
  auto* statement = static_cast<sqlite3_stmt*>(raw);
  std::vector<PlugInProxyPtr> proxies;
  while (sqlite3_step(statement) == SQLITE_ROW) proxies.push_back(readPlugInLocked(statement));
  return proxies;
}

PlugInProxyPtr SqliteRegistry::plugInByUuid(const Uuid& uuid) {
  checkLocale();
  std::lock_guard db(dbMutex_);
  Use find(statements_->plugInByUuid);
  find.uuid(1, uuid);
  return find.step() == SQLITE_ROW ? readPlugInLocked(find.get()) : nullptr;
}

PlugInProxyPtr SqliteRegistry::plugInByUrl(std::string_view urlOrPath) {
  auto path = pathFromUrlOrPath(urlOrPath);
  if (!path) return nullptr;
  checkLocale();
  std::lock_guard db(dbMutex_);
  Use find(statements_->plugInByPath);
  find.text(1, *path);
  return find.step() == SQLITE_ROW ? readPlugInLocked(find.get()) : nullptr;
}

std::vector<PlugInProxyPtr> SqliteRegistry::plugInsOfApplication(std::string_view appPath) {
  auto path = pathFromUrlOrPath(appPath);
  if (!path) return {};
  checkLocale();
  std::lock_guard db(dbMutex_);
  Use list(statements_->plugInsOfApp);
  list.text(1, *path);
  return readAllLocked(list.get());
}

std::vector<PlugInProxyPtr> SqliteRegistry::installedPlugIns() {
  checkLocale();
  std::lock_guard db(dbMutex_);
  Use list(statements_->allPlugIns);
  return readAllLocked(list.get());
}

namespace {

ApplicationProxyPtr readApplication(sqlite3_stmt* statement, sqlite3_stmt* uuids,
                                    const std::vector<std::string>& languages) {
  auto proxy = std::make_shared<ApplicationProxy>();
  proxy->path = columnText(statement, 0).value_or("");
  proxy->url = fileUrlForPath(proxy->path);
  proxy->identifier = columnText(statement, 1).value_or("");
  proxy->bundleVersion = columnText(statement, 2);
  proxy->info = columnDictionary(statement, 3);
  proxy->name = localizedName(proxy->info, columnDictionary(statement, 4), languages);
  proxy->registrationDate = Date{sqlite3_column_double(statement, 5)};
  Use list(uuids);
  list.text(1, proxy->path);
  while (list.step() == SQLITE_ROW) proxy->plugInUuids.push_back(columnUuid(uuids, 0));
  return proxy;
}

}  // namespace

ApplicationProxyPtr SqliteRegistry::applicationByPath(std::string_view urlOrPath) {
  auto path = pathFromUrlOrPath(urlOrPath);
  if (!path) return nullptr;
  checkLocale();
  std::lock_guard db(dbMutex_);
  Use find(statements_->appByPath);
  find.text(1, *path);
  if (find.step() != SQLITE_ROW) return nullptr;
  return readApplication(find.get(), statements_->plugInUuidsOfApp,
                         languageCandidates(languageLocked()));
}

ApplicationProxyPtr SqliteRegistry::applicationByIdentifier(std::string_view identifier) {
  checkLocale();
  std::lock_guard db(dbMutex_);
  Use find(statements_->appByIdentifier);
  find.text(1, identifier);
  if (find.step() != SQLITE_ROW) return nullptr;
  return readApplication(find.get(), statements_->plugInUuidsOfApp,
                         languageCandidates(languageLocked()));
}

std::vector<PlugInProxyPtr> SqliteRegistry::query(const Dictionary& rules,
                                                  const PlugInFilter& filter) {
  checkLocale();
  std::vector<PlugInProxyPtr> candidates;
  {
    std::lock_guard db(dbMutex_);
    for (const Uuid& uuid : uuidsLocked(rules)) {
      Use find(statements_->plugInByUuid);
      find.uuid(1, uuid);
      if (find.step() == SQLITE_ROW) candidates.push_back(readPlugInLocked(find.get()));
    }
  }
  if (!filter) return candidates;
  std::vector<PlugInProxyPtr> accepted;
  for (PlugInProxyPtr& candidate : candidates) {
    if (filter(*candidate)) accepted.push_back(std::move(candidate));
  }
  return accepted;
}

std::vector<Uuid> SqliteRegistry::queryUuids(const Dictionary& rules) {
  checkLocale();
  std::lock_guard db(dbMutex_);
  return uuidsLocked(rules);
}

std::vector<Uuid> SqliteRegistry::uuidsLocked(const Dictionary& rules) {
  // The lists read while the knowledge UUID stays the same are kept, keyed by the index keys
  // they read ("*" for all): one match of a busy extension point read hundreds of rows.
  auto points = indexedExtensionPoints(rules);
  std::set<std::string> keys;
  if (points) {
    for (const std::string& point : *points) keys.insert(extensionPointIndexKey(point));
  }
  std::string listKey = points ? "=" : "*";
  for (const std::string& key : keys) listKey += fmt::format("{}:{}", key.size(), key);
  if (uuidLists_.knowledge != knowledge_) {
    uuidLists_.lists.clear();
    uuidLists_.size = 0;
    uuidLists_.knowledge = knowledge_;
  }
  if (auto kept = uuidLists_.lists.find(listKey); kept != uuidLists_.lists.end()) {
    return kept->second;
  }

  std::vector<Uuid> uuids;
  bool complete = true;
  auto collect = [&](sqlite3_stmt* statement, std::set<Uuid>* seen) {
    int rc = SQLITE_ROW;
    while ((rc = sqlite3_step(statement)) == SQLITE_ROW) {
      Uuid uuid = columnUuid(statement, 0);
      if (!seen || seen->insert(uuid).second) uuids.push_back(uuid);
    }
    if (rc != SQLITE_DONE) complete = false;
  };
  if (!points) {
    Use list(statements_->allPlugInUuids);
    collect(list.get(), nullptr);
  } else {
    std::set<Uuid> seen;
    for (const std::string& key : keys) {
      Use list(statements_->plugInUuidsOfPoint);
      list.text(1, key);
      collect(list.get(), keys.size() > 1 ? &seen : nullptr);
    }
  }
  if (!complete) return uuids;
  // Rules come from clients: the kept lists are bounded by the UUIDs they hold together.
  if (uuidLists_.size + uuids.size() > kKeptUuidsLimit) {
    uuidLists_.lists.clear();
    uuidLists_.size = 0;
  }
  if (uuids.size() <= kKeptUuidsLimit) {
    uuidLists_.size += uuids.size();
    uuidLists_.lists.emplace(std::move(listKey), uuids);
  }
  return uuids;
}

size_t SqliteRegistry::plugInCount() {
  std::lock_guard db(dbMutex_);
  Use count(statements_->countPlugIns);
  return count.step() == SQLITE_ROW ? static_cast<size_t>(sqlite3_column_int64(count.get(), 0)) : 0;
}

std::optional<Dictionary> SqliteRegistry::extensionPointSdk(std::string_view identifier) {
  std::lock_guard db(dbMutex_);
  Use find(statements_->sdkOf);
  find.text(1, identifier);
  if (find.step() != SQLITE_ROW) return std::nullopt;
  return columnDictionary(find.get(), 0);
}

Dictionary SqliteRegistry::localizedStrings(const Uuid& plugIn, std::string_view table,
                                            const std::vector<std::string>& keys) {
  Dictionary result;
  if (!checkPlugInIdentifier(table).ok()) return result;
  PlugInProxyPtr proxy = plugInByUuid(plugIn);
  if (!proxy) return result;
  std::string language;
  {
    std::lock_guard db(dbMutex_);
    language = languageLocked();
  }
  for (const std::string& candidate : languageCandidates(language)) {
    auto value =
        dmap::readFileBeneath(proxy->path, fmt::format("{}.lproj/{}.strings", candidate, table));
    if (!value.ok() || value->dictionary() == nullptr) continue;
    for (const std::string& key : keys) {
      if (result.contains(key)) continue;
      if (const Value* text = value->get(key)) result.emplace(key, *text);
    }
  }
  return result;
}

Uuid SqliteRegistry::knowledgeUuid() {
  std::lock_guard lock(knowledgeMutex_);
  return knowledge_;
}

void SqliteRegistry::setKnowledge(const Uuid& knowledge) {
  std::lock_guard lock(knowledgeMutex_);
  knowledge_ = knowledge;
}

void SqliteRegistry::clearCaches() {
  // Proxies are built fresh from the database on every lookup; the only state worth
  // refreshing is the language.
  checkLocale();
}

// ---------------------------------------------------------------------------------------------
// Locale

std::string SqliteRegistry::languageLocked() {
  {
    std::lock_guard lock(localeMutex_);
    if (fileLanguage_) return *fileLanguage_;
  }
  return environmentLanguage();
}

void SqliteRegistry::checkLocale() {
  std::string file = paths::join(options_.stateDir, "locale");
  struct stat st {};
  std::optional<FileStamp> stamp;
  if (::stat(file.c_str(), &st) == 0) stamp = FileStamp::of(st);
  bool changed = false;
  {
    std::lock_guard lock(localeMutex_);
    if (localeSeen_ && stamp == localeStamp_) return;
    changed = localeSeen_;
    localeSeen_ = true;
    localeStamp_ = stamp;
    fileLanguage_ = stamp ? readLocaleFile(file) : std::nullopt;
  }
  if (changed) {
    log::vr().defaultLevel("locale file %s changed", file);
    deliverLocaleChange();
  }
}

// ---------------------------------------------------------------------------------------------
// Observers

void SqliteRegistry::addObserver(std::weak_ptr<RegistryObserver> observer) {
  std::lock_guard lock(observersMutex_);
  observers_.push_back(std::move(observer));
}

void SqliteRegistry::removeObserver(const std::shared_ptr<RegistryObserver>& observer) {
  std::lock_guard lock(observersMutex_);
  std::erase_if(observers_, [&](const std::weak_ptr<RegistryObserver>& weak) {
    auto strong = weak.lock();
    return !strong || strong == observer;
  });
}

std::vector<std::shared_ptr<RegistryObserver>> SqliteRegistry::liveObservers() {
  std::lock_guard lock(observersMutex_);
  std::vector<std::shared_ptr<RegistryObserver>> live;
  std::erase_if(observers_, [&](const std::weak_ptr<RegistryObserver>& weak) {
    auto strong = weak.lock();
    if (!strong) return true;
    live.push_back(std::move(strong));
    return false;
  });
  return live;
}

void SqliteRegistry::deliverInstall(std::vector<PlugInProxyPtr> plugIns) {
  if (plugIns.empty()) return;
  auto observers = liveObservers();
  if (observers.empty()) return;
  options_.queue->async([observers = std::move(observers), plugIns = std::move(plugIns)] {
    for (const auto& observer : observers) observer->pluginsDidInstall(plugIns);
  });
}

void SqliteRegistry::deliverUninstall(const std::vector<PlugInProxyPtr>& plugIns) {
  if (plugIns.empty()) return;
  auto observers = liveObservers();
  if (observers.empty()) return;
  auto deliver = [&] {
    for (const auto& observer : observers) observer->pluginsWillUninstall(plugIns);
  };
  if (options_.queue->isCurrent()) {
    deliver();
  } else {
    options_.queue->sync(deliver);
  }
}

void SqliteRegistry::deliverLocaleChange() {
  auto observers = liveObservers();
  if (observers.empty()) return;
  options_.queue->async([observers = std::move(observers)] {
    for (const auto& observer : observers) observer->localeDidChange();
  });
}

}  // namespace ek::vantor
