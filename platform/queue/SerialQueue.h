#pragma once

#include <asio/io_context.hpp>

#include <condition_variable>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace ek {

// The process's pool of worker threads: one io_context that every serial queue, listener and
// connection posts to.
class QueuePool {
 public:
  explicit QueuePool(unsigned threads);
  ~QueuePool();
  QueuePool(const QueuePool&) = delete;
  QueuePool& operator=(const QueuePool&) = delete;

  asio::io_context& context() { return context_; }
  // Stops the threads after the work in hand; idempotent.
  void shutdown();

  // The process-wide pool, made on first use with threadsForShared() threads.
  static QueuePool& shared();
  // Sets the thread count of the shared pool; only before its first use.
  static void setSharedThreads(unsigned threads);

 private:
  asio::io_context context_;
  std::unique_ptr<asio::executor_work_guard<asio::io_context::executor_type>> guard_;
  std::vector<std::thread> threads_;
  std::once_flag shutdownOnce_;
};

// A serial queue: blocks submitted to it run one at a time, in order, on the pool's threads.
// `sync` runs the block on the caller's thread once the queue is its own, so a queue that is
// only ever entered synchronously costs no thread hop. Entering a queue synchronously from
// that same queue would deadlock and is a broken invariant (it aborts).
class SerialQueue : public std::enable_shared_from_this<SerialQueue> {
 public:
  static std::shared_ptr<SerialQueue> make(
      std::string label, asio::io_context& context = QueuePool::shared().context());

  void async(std::function<void()> block);
  // async for a block that continues the work of the handler the calling thread runs: from a
  // thread of the queue's own context, an idle queue runs it on this thread right after that
  // handler returns, rather than waking another thread for it. The handler must not wait for
  // the block (nor enter this queue with sync) before it returns. From any other thread, async.
  void asyncContinuation(std::function<void()> block);
  // async, once the context has read the events waiting for it: for the next part of work that
  // gives way to others between its parts. A block queued from a block of this queue would run
  // in the same turn, before any request still unread on a socket.
  void asyncAfterEvents(std::function<void()> block);
  void sync(const std::function<void()>& block);

  // Whether the calling thread is running a block of this queue (also inside a sync).
  bool isCurrent() const;
  // Whether blocks (or sync callers) wait for their turn.
  bool hasWaiting() const;
  const std::string& label() const { return label_; }

  // The label of the innermost queue the calling thread runs on, or "" outside any queue.
  static std::string currentLabel();

 private:
  SerialQueue(std::string label, asio::io_context& context)
      : label_(std::move(label)), context_(context) {}
  void scheduleLocked(bool continuation = false);
  void drain();

  struct Waiter;

  const std::string label_;
  asio::io_context& context_;
  mutable std::mutex mutex_;
  std::condition_variable handedOver_;
  // Blocks to run; a null block marks where a sync caller takes the queue over.
  std::deque<std::function<void()>> blocks_;
  std::deque<Waiter*> waiters_;
  bool owned_ = false;  // a drain or a sync caller owns the queue
};

}  // namespace ek
