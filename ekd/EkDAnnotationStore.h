#pragma once

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
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

  // The largest change of an annotation, written as an entry of the file.
  static constexpr size_t kMaxAnnotationSize = 64 * 1024;

  // Opens the store on path (absent: defaultDatabaseURL()) and loads it. A file that is
  // missing starts an empty table silently; one that cannot be read or parsed, or has another
  // version, is logged "(resetting)", migration from the container is tried, and the table
  // starts empty. The bad file is left where it is, and the first save keeps a copy of it
  // beside the new file ("<file>.bad-<UTC timestamp>") before replacing it, so nothing a
  // person could recover is lost; when no copy can be made that is logged and the save goes
  // on, since refusing every later change would lose those too. Temporary files that a killed
  // daemon left beside the file are removed.
  static std::unique_ptr<EkDAnnotationStore> initWithDatabase(std::optional<std::string> path);

  std::optional<Dictionary> annotationForIdentifier(std::string_view key) const;
  // The same without a copy: valid until the next change of the table.
  const Dictionary* findAnnotation(std::string_view key) const;
  // The annotation under the plug-in's annotationKey().
  std::optional<Dictionary> annotationForPlugIn(const EkDPlugIn& plugIn) const;
  // Merges annotation into the stored one (same-named entries replaced, others kept), or
  // removes the plug-in's whole annotation when absent; then saves, unless saves are deferred.
  // A change that fails leaves the table as it was:
  //  - refused before anything changes: an annotation the file cannot carry or larger than
  //    kMaxAnnotationSize once written (the Ekora error 18), or one that would make the file
  //    larger than a reader accepts (the POSIX error EFBIG);
  //  - a failed save is logged and answered (the POSIX domain and errno for a system failure),
  //    and the change is undone.
  Result<void> setAnnotation(const std::optional<Dictionary>& annotation, const EkDPlugIn& plugIn);
  // The same by annotation key.
  Result<void> setAnnotation(const std::optional<Dictionary>& annotation, const std::string& key);

  // Changes made from deferSaves() until saveDeferred() are written once, by saveDeferred: a
  // request that changes many plug-ins then costs one durable write, made before its reply.
  // When that write fails, every change made since deferSaves() is undone, and the error (as
  // setAnnotation's) answered.
  void deferSaves();
  Result<void> saveDeferred();

  // Replaces the table with the file's "data" on success; on failure the table is unchanged
  // and the probe db-load fires with the error's domain and code. A version other than 16 is
  // the Ekora error 7 "found database version %d needed version %d".
  Result<void> loadDb(const std::string& path);
  // Writes the whole table atomically and durably (file and directory synced) to
  // annotationsURL(). The table is not changed, whatever the outcome.
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
  // Writes the text of every entry after a load. An entry the file cannot carry (a file written
  // by hand) is logged and left out, and the file is kept aside before it is replaced.
  void writeEveryEntry();
  // Puts value (absent: no entry) and its text under key, in the table, the index and written_.
  void place(const std::string& key, std::optional<Value> value, std::optional<std::string> text);
  // Undoes every change since the last save that succeeded or was not needed.
  void undoChanges();

  std::string annotationsURL_;
  Dictionary annotations_;
  // The entries of annotations_ by key: a lookup in a tree of 10,000 keys sharing a long prefix
  // compares most of each key a dozen times, for each plug-in of a reply.
  std::unordered_map<std::string_view, const Value*> index_;
  // The dmap text of each entry of annotations_, written when the entry changes (all of them
  // after a load, while allStale_): a save copies them into the document, without visiting the
  // annotations (with 10,000 of them, walking both trees cost more than writing the change).
  // Sorted by key, and contiguous: a save walks every entry, which a tree made slower than
  // the write itself.
  struct WrittenEntry {
    std::string key;
    std::string text;
  };
  std::vector<WrittenEntry> written_;
  size_t writtenBytes_ = 0;  // of all texts in written_
  bool allStale_ = true;
  // What each key changed since the last save held before its first change (absent: no
  // entry), so that a save that fails can put it back.
  struct Before {
    std::optional<Value> value;
    std::optional<std::string> text;
  };
  std::map<std::string, Before, std::less<>> before_;
  // Set when the file at annotationsURL_ exists but could not be used: it is kept aside
  // before the first save replaces it.
  bool keepBadFile_ = false;
  bool deferring_ = false;
  bool pendingSave_ = false;
  std::atomic<uint64_t> generation_{1};
};

}  // namespace ek
