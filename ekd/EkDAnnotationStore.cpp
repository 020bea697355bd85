#include "ekd/EkDAnnotationStore.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <utility>

#include <fmt/format.h>

#include "ekd/EkDPlugIn.h"
#include "platform/dmap/Dmap.h"
#include "platform/io/UniqueFd.h"
#include "platform/log/Log.h"
#include "platform/paths/Directories.h"
#include "platform/trace/Probes.h"

namespace ek {

namespace {

constexpr std::string_view kVersionKey = "version";
constexpr std::string_view kDataKey = "data";
constexpr std::string_view kAnnotationsFileName = "Ekora-Annotations";
constexpr std::string_view kContainersDirName = "containers";
constexpr std::string_view kContainerIdentifier = "com.corvane.ekd";
constexpr std::string_view kBadFileInfix = ".bad-";

constexpr int32_t kWrongVersionCode = 7;
constexpr std::string_view kWrongVersionMessage = "found database version %d needed version %d";

constexpr std::string_view kLogLoadFailed =
    "unable to load annotation database:%{public}@ error:%{public}@ (resetting)";
constexpr std::string_view kLogMigrating = "migrating shared annotations";
constexpr std::string_view kLogMigratedSaveFailed =
    "unable to save migrated annotations to %{public}@ error:%{public}@";
constexpr std::string_view kLogSaveFailed =
    "unable to save annotations:%{public}@ error:%{public}@";
constexpr std::string_view kLogNoContainer = "failed to get storage container: error=%llu";
constexpr std::string_view kFatalNoContainer = "unable to locate user container: error %llu";
constexpr std::string_view kLogKeptBadFile = "kept unusable annotation database %{public}@ as %@";
constexpr std::string_view kLogKeepBadFileFailed =
    "unable to keep unusable annotation database:%{public}@ aside error:%{public}@ (replacing "
    "it)";
constexpr std::string_view kLogUnwritableEntry =
    "dropping annotation %{public}@ of %{public}@: it cannot be written back: %{public}@";
constexpr std::string_view kLogRemovedTemporaries =
    "removed %zu temporary files a previous daemon left beside %{public}@";

// Annotations that cannot be stored are refused with the code of a malformed annotation.
constexpr int32_t kBadAnnotationCode = 18;
// The entries of "data" are this deep in the document.
constexpr size_t kEntryLevel = 2;
// What the document holds besides the entries' texts, generously.
constexpr size_t kDocumentFrame = 1024;

// Backup names tried for one timestamp before giving up: "<file>.bad-<stamp>", then "-1" ...
constexpr int kMaxBackupNames = 100;
constexpr size_t kCopyChunk = 64 * 1024;

// "version" as an integer, 0 when absent or not a number, as its 64-bit two's complement so
// that every stored number converts without overflow.
uint64_t versionBits(const Value& root) {
  const Value* version = root.get(kVersionKey);
  if (version == nullptr) return 0;
  if (const uint64_t* number = version->unsignedNumber()) return *number;
  if (const int64_t* number = version->negativeNumber()) return static_cast<uint64_t>(*number);
  if (const double* number = version->doubleNumber()) {
    // Outside int64's range the truncation would be undefined.
    if (!std::isfinite(*number) || *number >= 0x1p63 || *number < -0x1p63) return 0;
    return static_cast<uint64_t>(static_cast<int64_t>(*number));
  }
  return 0;
}

// The number as %d shows it: the low 32 bits, signed.
int32_t asPrintedInt(uint64_t bits) {
  return static_cast<int32_t>(static_cast<uint32_t>(bits));
}

std::string utcStamp() {
  std::time_t now = std::time(nullptr);
  std::tm utc{};
  gmtime_r(&now, &utc);
  char text[32];
  size_t length = std::strftime(text, sizeof text, "%Y%m%dT%H%M%SZ", &utc);
  return std::string(text, length);
}

Result<void> copyBytes(int from, int to, const std::string& source, const std::string& target) {
  char buffer[kCopyChunk];
  while (true) {
    ssize_t got = ::read(from, buffer, sizeof buffer);
    if (got < 0) {
      if (errno == EINTR) continue;
      return EkError::fromErrno(errno, "reading " + source);
    }
    if (got == 0) return {};
    for (ssize_t done = 0; done < got;) {
      ssize_t put = ::write(to, buffer + done, static_cast<size_t>(got - done));
      if (put < 0) {
        if (errno == EINTR) continue;
        return EkError::fromErrno(errno, "writing " + target);
      }
      done += put;
    }
  }
}

// Copies the regular file source to a new file target (same mode) and syncs it. False when
// target already exists; a partial copy is removed.
Result<bool> copyToNewFile(const std::string& source, const std::string& target) {
  UniqueFd in(::open(source.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
  if (in.get() < 0) return EkError::fromErrno(errno, "opening " + source);
  struct stat st {};
  if (::fstat(in.get(), &st) != 0) return EkError::fromErrno(errno, "examining " + source);
  if (!S_ISREG(st.st_mode)) return EkError::posix(EINVAL, source + ": not a regular file");

  UniqueFd out(::open(target.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
  if (out.get() < 0) {
    if (errno == EEXIST) return false;
    return EkError::fromErrno(errno, "creating " + target);
  }
  Result<void> copied = copyBytes(in.get(), out.get(), source, target);
  if (copied.ok() && ::fchmod(out.get(), st.st_mode & 0777) != 0) {
    copied = EkError::fromErrno(errno, "setting the mode of " + target);
  }
  if (copied.ok() && ::fsync(out.get()) != 0) {
    copied = EkError::fromErrno(errno, "syncing " + target);
  }
  if (copied.ok()) {
    if (out.close() != 0) copied = EkError::fromErrno(errno, "closing " + target);
  }
  if (!copied.ok()) {
    ::unlink(target.c_str());
    return copied.error();
  }
  return true;
}

}  // namespace

std::unique_ptr<EkDAnnotationStore> EkDAnnotationStore::initWithDatabase(
    std::optional<std::string> path) {
  std::unique_ptr<EkDAnnotationStore> store(new EkDAnnotationStore());
  store->annotationsURL_ = path ? std::move(*path) : defaultDatabaseURL();
  // Only this daemon writes the file, so a temporary beside it is a killed daemon's leftover.
  if (Result<size_t> removed = dmap::removeStaleTemporaries(store->annotationsURL_);
      removed.ok() && *removed > 0) {
    log::ops().defaultLevel(kLogRemovedTemporaries, *removed, store->annotationsURL_);
  }

  bool dataUsable = true;
  Result<void> loaded = store->load(store->annotationsURL_, dataUsable);
  if (loaded.ok()) {
    // Whatever the file held under "data" is gone from the table; keep it for a person.
    if (!dataUsable) store->keepBadFile_ = true;
    return store;
  }
  if (!loaded.error().isPosix(ENOENT)) {
    log::ops().error(kLogLoadFailed, store->annotationsURL_, loaded.error());
    store->keepBadFile_ = true;
  }

  // The container is a directory, so this fails today; it is where older annotations lived.
  Result<std::string> container = containerURL();
  if (container.ok()) {
    bool migratedUsable = true;
    if (store->load(*container, migratedUsable).ok()) {
      log::ops().info(kLogMigrating);
      Result<void> saved = store->saveDb();
      if (!saved.ok()) {
        log::ops().error(kLogMigratedSaveFailed, store->annotationsURL_, saved.error());
      }
    }
  }
  return store;
}

std::optional<Dictionary> EkDAnnotationStore::annotationForIdentifier(std::string_view key) const {
  const Dictionary* annotation = findAnnotation(key);
  if (annotation == nullptr) return std::nullopt;
  return *annotation;
}

const Dictionary* EkDAnnotationStore::findAnnotation(std::string_view key) const {
  auto it = index_.find(key);
  return it == index_.end() ? nullptr : it->second->dictionary();
}

std::optional<Dictionary> EkDAnnotationStore::annotationForPlugIn(const EkDPlugIn& plugIn) const {
  return annotationForIdentifier(plugIn.annotationKey());
}

Result<void> EkDAnnotationStore::setAnnotation(const std::optional<Dictionary>& annotation,
                                               const EkDPlugIn& plugIn) {
  return setAnnotation(annotation, plugIn.annotationKey());
}

Result<void> EkDAnnotationStore::setAnnotation(const std::optional<Dictionary>& annotation,
                                               const std::string& key) {
  writeEveryEntry();
  std::optional<Value> value;
  std::optional<std::string> text;
  if (annotation) {
    // The limit holds for what a change brings, not for the merged whole: an annotation that
    // grew large before the limit existed can still have its election changed.
    Result<std::string> change = dmap::writeEntry(key, Value(*annotation), kEntryLevel);
    if (change.ok() && change->size() > kMaxAnnotationSize) {
      return EkError::ekora(kBadAnnotationCode,
                            fmt::format("the annotation of {} is {} bytes once encoded, over the "
                                        "limit of {}",
                                        key, change->size(), kMaxAnnotationSize));
    }
    const Dictionary* current = findAnnotation(key);
    Dictionary merged = current ? *current : Dictionary{};
    for (const auto& [name, entry] : *annotation) merged.insert_or_assign(name, entry);
    value = Value(std::move(merged));
    Result<std::string> written =
        change.ok() ? dmap::writeEntry(key, *value, kEntryLevel) : std::move(change);
    if (!written.ok()) {
      return EkError::ekora(
          kBadAnnotationCode,
          fmt::format("the annotation of {} cannot be stored: {}", key, written.error().message));
    }
    text = std::move(written).value();
  }
  auto slot = std::lower_bound(
      written_.begin(), written_.end(), key,
      [](const WrittenEntry& entry, std::string_view name) { return entry.key < name; });
  const bool present = slot != written_.end() && slot->key == key;
  const size_t replaced = present ? slot->text.size() : 0;
  const size_t added = text ? text->size() : 0;
  // A reader refuses a file over the limit: such a file would lose every annotation.
  if (added > replaced && writtenBytes_ - replaced + added + kDocumentFrame > dmap::kMaxFileSize) {
    return EkError::posix(EFBIG, fmt::format("the annotation of {} would make {} larger than {} "
                                             "bytes",
                                             key, annotationsURL_, dmap::kMaxFileSize));
  }
  if (!before_.contains(key)) {
    const Value* stored = index_.contains(key) ? index_.at(key) : nullptr;
    before_.emplace(key, Before{stored ? std::optional<Value>(*stored) : std::nullopt,
                                present ? std::optional<std::string>(slot->text) : std::nullopt});
  }
  place(key, std::move(value), std::move(text));
  generation_.fetch_add(1, std::memory_order_release);
  pendingSave_ = true;
  if (deferring_) return {};
  return saveDeferred();
}

void EkDAnnotationStore::place(const std::string& key, std::optional<Value> value,
                               std::optional<std::string> text) {
  if (value) {
    auto entry = annotations_.insert_or_assign(key, std::move(*value)).first;
    index_.insert_or_assign(entry->first, &entry->second);
  } else {
    // The index's key refers to the table's: it goes first.
    index_.erase(key);
    annotations_.erase(key);
  }
  auto slot = std::lower_bound(
      written_.begin(), written_.end(), key,
      [](const WrittenEntry& entry, std::string_view name) { return entry.key < name; });
  const bool present = slot != written_.end() && slot->key == key;
  if (present) writtenBytes_ -= slot->text.size();
  if (!text) {
    if (present) written_.erase(slot);
    return;
  }
  writtenBytes_ += text->size();
  if (present) {
    slot->text = std::move(*text);
  } else {
    written_.insert(slot, {key, std::move(*text)});
  }
}

void EkDAnnotationStore::undoChanges() {
  for (auto& [key, before] : before_) place(key, std::move(before.value), std::move(before.text));
  before_.clear();
  pendingSave_ = false;
  // A new generation, not the old one again: what readers noted from the undone changes was
  // noted under the generations in between.
  generation_.fetch_add(1, std::memory_order_release);
}

void EkDAnnotationStore::writeEveryEntry() {
  if (!allStale_) return;
  written_.clear();
  written_.reserve(annotations_.size());
  writtenBytes_ = 0;
  for (auto it = annotations_.begin(); it != annotations_.end();) {
    Result<std::string> text = dmap::writeEntry(it->first, it->second, kEntryLevel);
    if (!text.ok()) {
      log::ops().error(kLogUnwritableEntry, it->first, annotationsURL_, text.error());
      keepBadFile_ = true;
      index_.erase(it->first);
      it = annotations_.erase(it);
      generation_.fetch_add(1, std::memory_order_release);
      continue;
    }
    writtenBytes_ += text->size();
    written_.push_back({it->first, std::move(text).value()});
    ++it;
  }
  allStale_ = false;
}

void EkDAnnotationStore::deferSaves() {
  deferring_ = true;
}

Result<void> EkDAnnotationStore::saveDeferred() {
  deferring_ = false;
  if (!std::exchange(pendingSave_, false)) {
    before_.clear();
    return {};
  }
  Result<void> saved = saveDb();
  if (!saved.ok()) {
    log::ops().error(kLogSaveFailed, annotationsURL_, saved.error());
    undoChanges();
    return saved;
  }
  before_.clear();
  return {};
}

Result<void> EkDAnnotationStore::loadDb(const std::string& path) {
  bool dataUsable = true;
  return load(path, dataUsable);
}

Result<void> EkDAnnotationStore::load(const std::string& path, bool& dataUsable) {
  Result<Value> root = dmap::readFile(path);
  std::optional<EkError> failure;
  if (!root.ok()) {
    failure = root.error();
  } else if (uint64_t version = versionBits(*root); version != static_cast<uint64_t>(kVersion)) {
    failure = EkError::ekora(kWrongVersionCode,
                             log::format(kWrongVersionMessage, asPrintedInt(version), kVersion));
  }
  if (failure) {
    EK_PROBE2(db_load, failure->domain.c_str(), static_cast<uint64_t>(failure->code));
    return *failure;
  }

  Dictionary* data = nullptr;
  if (Dictionary* top = root->dictionary()) {
    auto it = top->find(kDataKey);
    if (it != top->end()) {
      data = it->second.dictionary();
      dataUsable = data != nullptr;
    }
  }
  annotations_ = data != nullptr ? std::move(*data) : Dictionary{};
  index_.clear();
  index_.reserve(annotations_.size());
  for (const auto& [key, annotation] : annotations_) index_.emplace(key, &annotation);
  generation_.fetch_add(1, std::memory_order_release);
  written_.clear();
  writtenBytes_ = 0;
  before_.clear();
  allStale_ = true;
  return {};
}

Result<void> EkDAnnotationStore::saveDb() {
  writeEveryEntry();
  std::vector<const std::string*> entries;
  entries.reserve(written_.size());
  for (const WrittenEntry& entry : written_) entries.push_back(&entry.text);
  const Dictionary root{{std::string(kVersionKey), Value(kVersion)},
                        {std::string(kDataKey), Value(Dictionary{})}};
  std::string bytes = EK_TRY(dmap::writeAssembled(root, kDataKey, entries));

  std::filesystem::path directory = std::filesystem::path(annotationsURL_).parent_path();
  if (!directory.empty()) EK_TRY(paths::ensureDirectory(directory.string()));

  if (keepBadFile_) {
    Result<void> kept = keepBadFileAside();
    if (kept.ok()) {
      keepBadFile_ = false;
    } else {
      log::ops().error(kLogKeepBadFileFailed, annotationsURL_, kept.error());
    }
  }
  EK_TRY(dmap::writeBytesAtomically(annotationsURL_, bytes));
  keepBadFile_ = false;
  return {};
}

Result<void> EkDAnnotationStore::keepBadFileAside() const {
  const std::string base = annotationsURL_ + std::string(kBadFileInfix) + utcStamp();
  for (int attempt = 0; attempt < kMaxBackupNames; ++attempt) {
    std::string backup = attempt == 0 ? base : base + "-" + std::to_string(attempt);
    // A second name for the same bytes: the file stays where it is until the rename of the
    // save replaces it, and the directory sync of that save makes both names durable.
    if (::link(annotationsURL_.c_str(), backup.c_str()) == 0) {
      log::ops().defaultLevel(kLogKeptBadFile, annotationsURL_, backup);
      return {};
    }
    int error = errno;
    if (error == EEXIST) continue;
    if (error == ENOENT) {
      struct stat st {};
      // Gone since it failed to load: nothing is left to keep.
      if (::lstat(annotationsURL_.c_str(), &st) != 0 && errno == ENOENT) return {};
      return EkError::fromErrno(error, "linking " + annotationsURL_ + " to " + backup);
    }
    // Some file systems refuse hard links: copy the bytes instead.
    Result<bool> copied = copyToNewFile(annotationsURL_, backup);
    if (!copied.ok()) return copied.error();
    if (*copied) {
      log::ops().defaultLevel(kLogKeptBadFile, annotationsURL_, backup);
      return {};
    }
  }
  return EkError::posix(EEXIST, "no free name to keep " + annotationsURL_ + " aside");
}

std::string EkDAnnotationStore::defaultDatabaseURL() {
  return globalURL();
}

std::string EkDAnnotationStore::globalURL() {
  return paths::join(paths::stateDir(), kAnnotationsFileName);
}

Result<std::string> EkDAnnotationStore::containerURL() {
  std::string directory =
      paths::join(paths::join(paths::stateDir(), kContainersDirName), kContainerIdentifier);
  Result<void> made = paths::ensureDirectory(directory);
  if (!made.ok()) {
    // Without its own container the daemon's state is not what it relies on.
    unsigned long long code = static_cast<uint32_t>(made.error().code);
    log::ops().error(kLogNoContainer, code);
    std::string message = log::format(kFatalNoContainer, code);
    std::fprintf(stderr, "%s\n", message.c_str());
    std::abort();
  }
  return directory + "/";
}

}  // namespace ek
