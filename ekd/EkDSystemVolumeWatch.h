#pragma once

#include <asio/io_context.hpp>
#include <asio/posix/stream_descriptor.hpp>
#include <asio/steady_timer.hpp>
#include <asio/strand.hpp>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "platform/queue/SerialQueue.h"
#include "platform/value/Result.h"

namespace ek {

// Registers and unregisters system plug-ins as bundles come and go on the system volume, so
// that installing or removing a package needs no restart of the daemon.
//
// The plug-ins directory is watched with inotify for entries made, removed or renamed in it. A
// burst of changes (a package manager unpacking many bundles) is followed by one rescan once
// nothing has changed for `settle`. Rescans run one at a time on a queue of their own, never on
// the threads that serve requests; a change during a rescan is followed by another.
class EkDSystemVolumeWatch : public std::enable_shared_from_this<EkDSystemVolumeWatch> {
 public:
  using Clock = std::chrono::steady_clock;

  // Watches directory when it exists; when it does not, only requestRescan starts rescans.
  static Result<std::shared_ptr<EkDSystemVolumeWatch>> make(asio::io_context& context,
                                                            const std::string& directory,
                                                            Clock::duration settle,
                                                            std::function<void()> rescan);
  ~EkDSystemVolumeWatch();

  // A rescan after the settle time, as for a change (SIGHUP asks for one). Any thread.
  void requestRescan();
  // A rescan at once (the start-up scan), unless one is queued already. Any thread.
  void rescanNow();
  // Stops watching; a rescan already running finishes. Any thread.
  void cancel();

  bool watching() const { return watching_; }

 private:
  EkDSystemVolumeWatch(asio::io_context& context, Clock::duration settle,
                       std::function<void()> rescan);
  void readEvents();
  void settleThenRescan();

  asio::posix::stream_descriptor inotify_;
  asio::strand<asio::io_context::executor_type> strand_;
  asio::steady_timer timer_;  // on strand_
  const Clock::duration settle_;
  const std::function<void()> rescan_;
  std::shared_ptr<SerialQueue> queue_;
  std::atomic<bool> queued_{false};
  std::atomic<bool> watching_{false};
  alignas(alignof(uint32_t)) char buffer_[8192];  // on strand_
};

}  // namespace ek
