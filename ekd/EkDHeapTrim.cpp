#include "ekd/EkDHeapTrim.h"

#include <malloc.h>

namespace ek {

std::shared_ptr<EkDHeapTrim> EkDHeapTrim::make(asio::io_context& context, Clock::duration quiet,
                                               std::function<void()> trim) {
  if (!trim) trim = [] { ::malloc_trim(0); };
  return std::shared_ptr<EkDHeapTrim>(new EkDHeapTrim(context, quiet, std::move(trim)));
}

EkDHeapTrim::EkDHeapTrim(asio::io_context& context, Clock::duration quiet,
                         std::function<void()> trim)
    : timer_(context), quiet_(quiet), trim_(std::move(trim)) {}

void EkDHeapTrim::activity() {
  last_.store(Clock::now().time_since_epoch().count());
  if (!armed_.load(std::memory_order_relaxed) && !armed_.exchange(true)) arm(quiet_);
}

void EkDHeapTrim::arm(Clock::duration after) {
  timer_.expires_after(after);
  timer_.async_wait([weak = weak_from_this()](const asio::error_code& error) {
    auto self = weak.lock();
    if (!self || error) return;
    self->expired();
  });
}

void EkDHeapTrim::expired() {
  auto seen = last_.load();
  auto idle = Clock::now().time_since_epoch() - Clock::duration(seen);
  if (idle < quiet_) {
    arm(quiet_ - idle);
    return;
  }
  trim_();
  armed_.store(false);
  // Activity between the reading of last_ and the clearing of armed_ saw the timer armed and
  // left it alone: take it on here.
  if (last_.load() != seen && !armed_.exchange(true)) arm(quiet_);
}

}  // namespace ek
