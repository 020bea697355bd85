#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/io/FileStamp.h"
#include "platform/io/UniqueFd.h"

namespace ek::vantor {

// The files one bundle's registration was read from, each with what stat said of it just
// before it was read, or that it was absent. When every one of them stats the same again, the
// bundle would read the same: the start-up scan then leaves it alone without opening a file.
//
// A file changed within kSettleSeconds of being noted may change again without its stamp
// changing (the file system's clock is coarse), so such a record is not kept at all: the next
// scan reads the bundle and notes it again.
class BundleSources {
 public:
  static constexpr int64_t kSettleSeconds = 2;
  // Bounds on a decoded record, which comes from the registry file.
  static constexpr size_t kMaxSources = 4096;
  static constexpr size_t kMaxRecordBytes = 1 << 20;

  // The context is everything besides the files that decides what reading gives (the state
  // directory, the system root, the user): a record made in another context never matches.
  // Tests shorten settleSeconds.
  explicit BundleSources(std::string context, int64_t settleSeconds = kSettleSeconds);

  // Stats path now, before it is read. Shared files (an extension point's SDK) are read by
  // many bundles; the checker stats each of them once per scan.
  void note(const std::string& path);
  void noteShared(const std::string& path);
  // Something that decided the reading is not a file: the bundle must always be read again.
  void markUncheckable() { checkable_ = false; }

  // The record to keep, absent when it could not prove the bundle unchanged later.
  std::optional<std::vector<uint8_t>> record() const;

  // What a look at a file found. Unknown: it could not be told (EACCES, EIO).
  enum class Look { Present, Absent, Unknown };

  // Checks records against the file system as it is now; one per scan.
  class Checker {
   public:
    explicit Checker(std::string context) : context_(std::move(context)) {}
    // True only when the record is well formed, made in this context, and every file in it
    // stats as recorded (an absent one still absent).
    bool unchanged(std::span<const uint8_t> record);

   private:
    // Stats path, relative to the directory of the last path looked at when it lies below it:
    // the files of one bundle, and the bundles of one directory, then share the walk of their
    // common path.
    Look look(std::string_view path, FileStamp& stamp);

    std::string context_;
    std::unordered_map<std::string, std::optional<FileStamp>> shared_;
    std::string directory_;  // with its trailing slash
    UniqueFd directoryFd_;
  };

 private:
  struct Source {
    std::string path;
    std::optional<FileStamp> stamp;  // absent: the file did not exist
    bool shared = false;
  };
  void add(const std::string& path, bool shared);

  std::string context_;
  int64_t settleSeconds_;
  std::vector<Source> sources_;
  bool checkable_ = true;
};

}  // namespace ek::vantor
