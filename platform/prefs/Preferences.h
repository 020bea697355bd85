#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "platform/io/FileStamp.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

// Preferences domains: one dmap dictionary per domain and user, kept in
// $EKORA_STATE_DIR/preferences/<uid>/<domain>.dmap. Readers synchronise when they want to see
// what another process wrote; writers replace the file atomically.
namespace ek::prefs {

// A domain name is one path component of at most this many bytes.
inline constexpr size_t kMaxDomainNameLength = 200;

// Refuses names that are not one usable path component: empty, ".", "..", holding '/' or NUL,
// or longer than kMaxDomainNameLength. The error is POSIX EINVAL.
Result<void> checkDomainName(std::string_view domain);

// $EKORA_STATE_DIR/preferences/<uid>/<domain>.dmap, for a name checkDomainName accepts.
std::string domainPath(std::string_view domain, uid_t uid);

// Domain D of user U. Thread-safe: every member takes the one mutex.
class PreferencesDomain {
 public:
  // Binds the domain to its file (the state directory is read now) and reads the file once.
  // An invalid domain name is checkDomainName's error.
  static Result<std::unique_ptr<PreferencesDomain>> open(std::string_view domain, uid_t uid);
  static Result<std::unique_ptr<PreferencesDomain>> open(std::string_view domain);

  const std::string& domain() const { return domain_; }
  const std::string& path() const { return path_; }

  // Re-reads the file when its inode, size or modification time changed since the last read.
  // A missing file is an empty domain. A file that cannot be read, is not dmap or whose root
  // is not a dictionary is an empty domain too, logged as an error once per change of the
  // file.
  void synchronize();

  // Answers from the contents of the last read; synchronize() first to see other writers.
  std::optional<Value> value(std::string_view key) const;
  Dictionary dictionary() const;
  // Whether the file existed at the last read (even when unreadable).
  bool exists() const;
  // Why the file read last was treated as empty; nothing when it was fine or missing.
  std::optional<EkError> readError() const;

  // Each re-reads the file, changes it and writes the whole dictionary back atomically
  // (0644; missing directories are created 0755), so keys another writer set meanwhile are
  // kept. Writers of one user's domains exclude each other with a lock on the directory. A
  // file that was unreadable as a dictionary is replaced. Errors are those of the write; a
  // value dmap cannot carry is its Format error and nothing is touched.
  Result<void> set(std::string_view key, Value value);
  // Removing a key that is not there writes nothing and is not an error.
  Result<void> remove(std::string_view key);
  // Leaves an empty dictionary (the file stays).
  Result<void> removeAll();

 private:
  PreferencesDomain(std::string domain, std::string path);

  // REQUIRES: mutex_ held. Re-reads when the stamp changed, or always when force is set.
  void reload(bool force);
  // REQUIRES: mutex_ held. Re-reads under the directory lock, applies change to a copy of
  // the dictionary and writes it back when change answers true.
  Result<void> modify(const std::function<bool(Dictionary&)>& change);
  // REQUIRES: mutex_ held. Logs a failed read unless this version of the file was logged.
  void noteFailure(const EkError& error);

  const std::string domain_;
  const std::string path_;

  // Everything below is guarded by mutex_.
  mutable std::mutex mutex_;
  Dictionary contents_;
  // Whether stamp_ describes the file read last (false before the first read and after a
  // failure to look at the file, so the next synchronize() reads again).
  bool current_ = false;
  std::optional<FileStamp> stamp_;  // of the file read last; nothing when it was missing
  std::optional<EkError> readError_;
  // The version of the file and the failure logged last, so each is logged once.
  std::optional<std::pair<std::optional<FileStamp>, std::string>> logged_;
};

// The daemon's seam: one value of one domain, as it stands now.
class Preferences {
 public:
  virtual ~Preferences() = default;
  // Synchronises the domain, then answers the value under key; nothing for a missing domain
  // or key, or an invalid domain name.
  virtual std::optional<Value> value(std::string_view domain, std::string_view key) = 0;
};

// The domain files of one user.
class FilePreferences : public Preferences {
 public:
  explicit FilePreferences(uid_t uid);
  // For the effective user.
  FilePreferences();

  std::optional<Value> value(std::string_view domain, std::string_view key) override;

 private:
  const uid_t uid_;
  std::mutex mutex_;
  std::map<std::string, std::unique_ptr<PreferencesDomain>, std::less<>> domains_;  // mutex_
};

// An in-memory double.
class FakePreferences : public Preferences {
 public:
  std::optional<Value> value(std::string_view domain, std::string_view key) override;

  void set(std::string_view domain, std::string_view key, Value value);
  void remove(std::string_view domain, std::string_view key);

 private:
  std::mutex mutex_;
  std::map<std::string, Dictionary, std::less<>> domains_;  // guarded by mutex_
};

}  // namespace ek::prefs
