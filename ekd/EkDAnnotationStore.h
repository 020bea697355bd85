#pragma once

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace ek {

class EkDPlugIn;

// The user's per-plug-in choices (annotations), kept in memory and written through to one dmap
// file after every change: {"version": 16, "data": {annotation key: annotation}}.
//
// Not thread-safe: the database makes every call on its serial queue, but for generation().
class EkDAnnotationStore {
 public:
  static constexpr int64_t kVersion = 16;

  // The index refers into the table: a copy would refer into the original's.
  EkDAnnotationStore(const EkDAnnotationStore&) = delete;
  EkDAnnotationStore& operator=(const EkDAnnotationStore&) = delete;

  // Opens the store on path (absent: defaultDatabaseURL()) and loads it. A file that is
  // missing starts an empty table silently; one that cannot be read or parsed, or has another
  // version, is logged "(resetting)", migration from the container is tried, and the table
  // starts empty. The bad file is left where it is, and the first save keeps a copy of it
  // beside the new file ("<file>.bad-<UTC timestamp>") before replacing it, so nothing a
  // person could recover is lost.
  static std::unique_ptr<EkDAnnotationStore> initWithDatabase(std::optional<std::string> path);

  std::optional<Dictionary> annotationForIdentifier(std::string_view key) const;
  // The same without a copy: valid until the next change of the table.
  const Dictionary* findAnnotation(std::string_view key) const;
  // The annotation under the plug-in's annotationKey().
  std::optional<Dictionary> annotationForPlugIn(const EkDPlugIn& plugIn) const;
  // Merges annotation into the stored one (same-named entries replaced, others kept), or
  // removes the plug-in's whole annotation when absent; then saves. A failed save is logged
  // and the change stays in memory until the next successful save.
  void setAnnotation(const std::optional<Dictionary>& annotation, const EkDPlugIn& plugIn);
  // The same by annotation key.
  void setAnnotation(const std::optional<Dictionary>& annotation, const std::string& key);

  // Changes made from deferSaves() until saveDeferred() are written once, by saveDeferred: a
  // request that changes many plug-ins then costs one durable write, made before its reply.
  void deferSaves();
  void saveDeferred();

  // Replaces the table with the file's "data" on success; on failure the table is unchanged
  // and the probe db-load fires with the error's domain and code. A version other than 16 is
  // the Ekora error 7 "found database version %d needed version %d".
  Result<void> loadDb(const std::string& path);
  // Writes the whole table atomically and durably (file and directory synced) to
  // annotationsURL().
  Result<void> saveDb();

  // $EKORA_STATE_DIR/Ekora-Annotations.
  static std::string defaultDatabaseURL();
  static std::string globalURL();
  // The daemon's system-data container, created when missing: the migration source.
  static Result<std::string> containerURL();

  // Counts the changes of the table, from 1. What a reader took from the table while the
  // generation was G is still the table's while it is G. Safe to read from any thread.
  uint64_t generation() const { return generation_.load(std::memory_order_acquire); }

  const std::string& annotationsURL() const { return annotationsURL_; }
  const Dictionary& annotations() const { return annotations_; }

 private:
  EkDAnnotationStore() = default;

  // loadDb, also telling whether the file's "data" was a dictionary (the table starts empty
  // when it was not).
  Result<void> load(const std::string& path, bool& dataUsable);
  // Keeps the file at annotationsURL_ beside it under a name not yet taken.
  Result<void> keepBadFileAside() const;

  std::string annotationsURL_;
  Dictionary annotations_;
  // The entries of annotations_ by key: a lookup in a tree of 10,000 keys sharing a long prefix
  // compares most of each key a dozen times, for each plug-in of a reply.
  std::unordered_map<std::string_view, const Value*> index_;
  // The dmap text of each entry of annotations_ as last saved, but for the keys changed since
  // (stale_), or all of them (allStale_, after a load).
  // Sorted by key, and contiguous: a save walks every entry, which a tree made slower than
  // the write itself.
  struct WrittenEntry {
    std::string key;
    std::string text;
  };
  std::vector<WrittenEntry> written_;
  std::set<std::string, std::less<>> stale_;
  bool allStale_ = true;
  // Set when the file at annotationsURL_ exists but could not be used: it is kept aside
  // before the first save replaces it.
  bool keepBadFile_ = false;
  bool deferring_ = false;
  bool pendingSave_ = false;
  std::atomic<uint64_t> generation_{1};
};

}  // namespace ek
