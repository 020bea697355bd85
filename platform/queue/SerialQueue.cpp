#include "platform/queue/SerialQueue.h"

#include <asio/defer.hpp>
#include <asio/post.hpp>

#include <algorithm>
#include <cstdio>
#include <cstdlib>

namespace ek {
namespace {

// The queues the calling thread runs on, innermost last.
thread_local std::vector<const SerialQueue*> tCurrent;

struct CurrentGuard {
  explicit CurrentGuard(const SerialQueue* q) { tCurrent.push_back(q); }
  ~CurrentGuard() { tCurrent.pop_back(); }
};

unsigned gSharedThreads = 4;

// A drain runs this many blocks before yielding its thread to other queues.
constexpr int kBlocksPerTurn = 64;

}  // namespace

QueuePool::QueuePool(unsigned threads)
    : guard_(std::make_unique<asio::executor_work_guard<asio::io_context::executor_type>>(
          context_.get_executor())) {
  threads = std::max(1u, threads);
  for (unsigned i = 0; i < threads; ++i) {
    threads_.emplace_back([this] { context_.run(); });
  }
}

QueuePool::~QueuePool() {
  shutdown();
}

void QueuePool::shutdown() {
  std::call_once(shutdownOnce_, [this] {
    guard_.reset();
    context_.stop();
    for (auto& t : threads_) {
      if (t.get_id() == std::this_thread::get_id()) {
        t.detach();
      } else if (t.joinable()) {
        t.join();
      }
    }
  });
}

QueuePool& QueuePool::shared() {
  // Never destroyed: blocks may still be running on its threads while the process exits.
  static QueuePool* pool = new QueuePool(gSharedThreads);
  return *pool;
}

void QueuePool::setSharedThreads(unsigned threads) {
  gSharedThreads = threads;
}

struct SerialQueue::Waiter {
  bool granted = false;
};

std::shared_ptr<SerialQueue> SerialQueue::make(std::string label, asio::io_context& context) {
  return std::shared_ptr<SerialQueue>(new SerialQueue(std::move(label), context));
}

void SerialQueue::async(std::function<void()> block) {
  std::lock_guard lock(mutex_);
  blocks_.push_back(std::move(block));
  if (!owned_) scheduleLocked();
}

void SerialQueue::asyncContinuation(std::function<void()> block) {
  std::lock_guard lock(mutex_);
  blocks_.push_back(std::move(block));
  if (!owned_) scheduleLocked(context_.get_executor().running_in_this_thread());
}

void SerialQueue::asyncAfterEvents(std::function<void()> block) {
  asio::post(context_, [self = shared_from_this(), block = std::move(block)]() mutable {
    self->async(std::move(block));
  });
}

void SerialQueue::scheduleLocked(bool continuation) {
  owned_ = true;
  auto drain = [self = shared_from_this()] { self->drain(); };
  // A deferred handler goes to this thread's own queue of the context and runs once the
  // current handler returns; a posted one may wake another thread.
  if (continuation) {
    asio::defer(context_, std::move(drain));
  } else {
    asio::post(context_, std::move(drain));
  }
}

void SerialQueue::drain() {
  CurrentGuard current(this);
  for (int turn = 0; turn < kBlocksPerTurn; ++turn) {
    std::function<void()> block;
    {
      std::unique_lock lock(mutex_);
      if (blocks_.empty()) {
        owned_ = false;
        return;
      }
      block = std::move(blocks_.front());
      blocks_.pop_front();
      if (!block) {
        // A sync caller's turn: hand the queue over; it reschedules us when done.
        Waiter* waiter = waiters_.front();
        waiters_.pop_front();
        waiter->granted = true;
        handedOver_.notify_all();
        return;
      }
    }
    block();
  }
  std::lock_guard lock(mutex_);
  if (blocks_.empty()) {
    owned_ = false;
  } else {
    scheduleLocked();
  }
}

void SerialQueue::sync(const std::function<void()>& block) {
  // The block may drop the caller's last reference; the queue must outlive this call.
  auto self = shared_from_this();
  if (isCurrent()) {
    std::fprintf(stderr, "SerialQueue::sync: re-entered queue \"%s\"\n", label_.c_str());
    std::abort();
  }
  {
    std::unique_lock lock(mutex_);
    if (!owned_) {
      owned_ = true;
    } else {
      Waiter waiter;
      waiters_.push_back(&waiter);
      blocks_.push_back(nullptr);
      handedOver_.wait(lock, [&] { return waiter.granted; });
    }
  }
  {
    CurrentGuard current(this);
    block();
  }
  std::lock_guard lock(mutex_);
  if (blocks_.empty()) {
    owned_ = false;
  } else if (!blocks_.front()) {
    Waiter* waiter = waiters_.front();
    waiters_.pop_front();
    blocks_.pop_front();
    waiter->granted = true;
    handedOver_.notify_all();
  } else {
    scheduleLocked();
  }
}

bool SerialQueue::hasWaiting() const {
  std::lock_guard lock(mutex_);
  return !blocks_.empty();
}

bool SerialQueue::isCurrent() const {
  return std::find(tCurrent.begin(), tCurrent.end(), this) != tCurrent.end();
}

std::string SerialQueue::currentLabel() {
  return tCurrent.empty() ? "" : tCurrent.back()->label();
}

}  // namespace ek
