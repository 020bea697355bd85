#pragma once

#include <asio/io_context.hpp>
#include <asio/steady_timer.hpp>
#include <atomic>
#include <chrono>
#include <functional>
#include <memory>

namespace ek {

// Gives freed heap back to the system once requests have stopped for a while.
//
// A burst of requests (a large match, a bulk list, a client that stopped reading) leaves
// freed memory that the allocator keeps whenever a live block sits above it, so the daemon's
// footprint would depend on where its last burst happened to leave things. After `quiet`
// with no activity the trim function runs once; a daemon that stays idle is never woken.
class EkDHeapTrim : public std::enable_shared_from_this<EkDHeapTrim> {
 public:
  using Clock = std::chrono::steady_clock;

  // `trim` defaults to giving every free page of the heap back (malloc_trim).
  static std::shared_ptr<EkDHeapTrim> make(asio::io_context& context, Clock::duration quiet,
                                           std::function<void()> trim = {});

  // Called for each request, from any thread: a clock read, and a timer only when none is
  // armed.
  void activity();

 private:
  EkDHeapTrim(asio::io_context& context, Clock::duration quiet, std::function<void()> trim);
  // Only the thread that set armed_ touches timer_ until armed_ is cleared again.
  void arm(Clock::duration after);
  void expired();

  asio::steady_timer timer_;
  const Clock::duration quiet_;
  const std::function<void()> trim_;
  std::atomic<Clock::rep> last_{0};
  std::atomic<bool> armed_{false};
};

}  // namespace ek
