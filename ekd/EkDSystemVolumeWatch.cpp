#include "ekd/EkDSystemVolumeWatch.h"

#include <sys/inotify.h>
#include <asio/bind_executor.hpp>
#include <asio/dispatch.hpp>
#include <asio/post.hpp>

#include <cerrno>
#include <cstring>

#include "platform/log/Log.h"

namespace ek {

EkDSystemVolumeWatch::EkDSystemVolumeWatch(asio::io_context& context, Clock::duration settle,
                                           std::function<void()> rescan)
    : inotify_(context),
      strand_(asio::make_strand(context)),
      timer_(strand_),
      settle_(settle),
      rescan_(std::move(rescan)),
      queue_(SerialQueue::make("system-volume")) {}

EkDSystemVolumeWatch::~EkDSystemVolumeWatch() = default;

Result<std::shared_ptr<EkDSystemVolumeWatch>> EkDSystemVolumeWatch::make(
    asio::io_context& context, const std::string& directory, Clock::duration settle,
    std::function<void()> rescan) {
  std::shared_ptr<EkDSystemVolumeWatch> watch(
      new EkDSystemVolumeWatch(context, settle, std::move(rescan)));
  int fd = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  if (fd < 0) return EkError::fromErrno(errno, "creating an inotify instance");
  watch->inotify_.assign(fd);
  // Entries of the directory itself: a bundle is made, removed or moved in or out whole.
  constexpr uint32_t kEvents = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO |
                               IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
  if (::inotify_add_watch(fd, directory.c_str(), kEvents) < 0) {
    if (errno != ENOENT && errno != ENOTDIR) {
      return EkError::fromErrno(errno, "watching " + directory);
    }
    log::vr().info("%s does not exist: system plug-ins are read at start and on SIGHUP only",
                   directory);
    return watch;
  }
  watch->watching_ = true;
  asio::dispatch(watch->strand_, [watch] { watch->readEvents(); });
  return watch;
}

void EkDSystemVolumeWatch::readEvents() {
  inotify_.async_read_some(
      asio::buffer(buffer_),
      asio::bind_executor(strand_, [weak = weak_from_this()](const asio::error_code& error,
                                                             size_t size) {
        auto self = weak.lock();
        if (!self || error) return;
        bool gone = false;
        for (size_t offset = 0; offset + sizeof(inotify_event) <= size;) {
          inotify_event event;
          std::memcpy(&event, self->buffer_ + offset, sizeof event);
          gone = gone || (event.mask & (IN_DELETE_SELF | IN_MOVE_SELF | IN_IGNORED));
          offset += sizeof event + event.len;
        }
        self->settleThenRescan();
        if (gone) {
          log::vr().error("the system plug-ins directory was removed or moved: no longer watched");
          self->watching_ = false;
          return;
        }
        self->readEvents();
      }));
}

void EkDSystemVolumeWatch::settleThenRescan() {
  // Every change puts the rescan off again: one rescan after a burst, not one per bundle.
  timer_.expires_after(settle_);
  timer_.async_wait([weak = weak_from_this()](const asio::error_code& error) {
    auto self = weak.lock();
    if (!self || error) return;
    self->rescanNow();
  });
}

void EkDSystemVolumeWatch::rescanNow() {
  if (queued_.exchange(true)) return;
  queue_->async([self = shared_from_this()] {
    // Cleared first: a change from here on is not covered by this rescan.
    self->queued_ = false;
    self->rescan_();
  });
}

void EkDSystemVolumeWatch::requestRescan() {
  asio::post(strand_, [self = shared_from_this()] { self->settleThenRescan(); });
}

void EkDSystemVolumeWatch::cancel() {
  asio::post(strand_, [self = shared_from_this()] {
    asio::error_code ignored;
    self->timer_.cancel();
    self->inotify_.close(ignored);
    self->watching_ = false;
  });
}

}  // namespace ek
