#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/value/Result.h"

// System-wide notifications. Posting N replaces <dir>/N atomically with the next generation
// number (decimal text); watchers see one inotify event per post. Any process may post or
// watch; the generation only ever grows, also when several processes post at once.
namespace ek::notify {

// A notification name names a file, so it must be one path component: not empty, not "." or
// "..", no "/" and no NUL, at most 255 bytes.
Result<void> checkName(std::string_view name);

// The daemon's seam: what it posts goes through a Notifier, so unit tests can count posts.
class Notifier {
 public:
  virtual ~Notifier() = default;
  // Posts name. Failures are logged by the implementation; posting never blocks on watchers.
  virtual void post(std::string_view name) = 0;
};

// Posts into a directory (by default paths::notificationsDir(), created on first post).
class FileNotifier final : public Notifier {
 public:
  explicit FileNotifier(std::string directory = {});
  void post(std::string_view name) override;
  const std::string& directory() const { return directory_; }

 private:
  std::string directory_;
};

// Records posts in memory.
class FakeNotifier final : public Notifier {
 public:
  void post(std::string_view name) override;
  std::vector<std::string> posts() const;
  size_t count(std::string_view name) const;

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> posts_;
};

// Posts name in directory (empty: paths::notificationsDir()) and answers the new generation.
// Posters serialise on an exclusive flock of the directory itself; the new contents are
// written to "<directory>/.posting" and renamed over the name, so a watcher of ".posting"
// would see every poster's temporary file.
Result<uint64_t> post(std::string_view name, const std::string& directory = {});
// The last generation posted for name; 0 when it was never posted or the file is unreadable.
uint64_t generation(std::string_view name, const std::string& directory = {});

// Watches a set of names in one directory with inotify. Each post of a watched name yields
// one entry; its generation is read from the file when the event is handled, so posts that
// pile up before next() is called may report a later generation than the one they wrote.
class Watcher {
 public:
  static Result<std::unique_ptr<Watcher>> create(std::vector<std::string> names,
                                                 const std::string& directory = {});
  ~Watcher();
  Watcher(const Watcher&) = delete;
  Watcher& operator=(const Watcher&) = delete;

  // The next posts of watched names (name, generation), waiting at most timeout (forever when
  // absent). Empty when the time ran out.
  Result<std::vector<std::pair<std::string, uint64_t>>> next(
      std::optional<std::chrono::milliseconds> timeout = std::nullopt);
  // Pollable descriptor: readable when next() has something.
  int fd() const { return fd_; }

 private:
  Watcher() = default;
  int fd_ = -1;
  std::string directory_;
  std::vector<std::string> names_;
  // The last generation answered per name (parallel to names_), so that a queue overflow,
  // which loses the events themselves, can still report every name that was posted since.
  std::vector<uint64_t> seen_;
};

}  // namespace ek::notify
