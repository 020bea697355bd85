#include "platform/queue/SerialQueue.h"

#include <gtest/gtest.h>

#include <asio/post.hpp>

#include <atomic>
#include <future>
#include <thread>
#include <vector>

namespace ek {
namespace {

TEST(SerialQueue, RunsAsyncBlocksInSubmissionOrder) {
  QueuePool pool(4);
  auto queue = SerialQueue::make("order", pool.context());
  std::vector<int> seen;
  std::promise<void> finished;
  for (int i = 0; i < 1000; ++i) {
    queue->async([&, i] {
      seen.push_back(i);
      if (i == 999) finished.set_value();
    });
  }
  finished.get_future().wait();
  ASSERT_EQ(seen.size(), 1000u);
  for (int i = 0; i < 1000; ++i) EXPECT_EQ(seen[i], i);
}

TEST(SerialQueue, KnowsWhetherBlocksWaitBehindTheRunningOne) {
  QueuePool pool(2);
  auto queue = SerialQueue::make("waiting", pool.context());
  EXPECT_FALSE(queue->hasWaiting());
  std::promise<void> release;
  std::promise<bool> firstSaw, secondSaw;
  std::promise<void> started;
  queue->async([&] {
    started.set_value();
    release.get_future().wait();
    firstSaw.set_value(queue->hasWaiting());
  });
  started.get_future().wait();
  EXPECT_FALSE(queue->hasWaiting());  // the running block does not count
  queue->async([&] { secondSaw.set_value(queue->hasWaiting()); });
  EXPECT_TRUE(queue->hasWaiting());
  release.set_value();
  EXPECT_TRUE(firstSaw.get_future().get());
  EXPECT_FALSE(secondSaw.get_future().get());
  EXPECT_FALSE(queue->hasWaiting());
}

TEST(SerialQueue, NeverRunsTwoBlocksAtOnce) {
  QueuePool pool(4);
  auto queue = SerialQueue::make("exclusive", pool.context());
  std::atomic<int> inside{0};
  std::atomic<bool> overlapped{false};
  std::atomic<int> done{0};
  auto body = [&] {
    if (inside.fetch_add(1) != 0) overlapped = true;
    std::this_thread::yield();
    inside.fetch_sub(1);
    done.fetch_add(1);
  };
  std::vector<std::thread> producers;
  for (int t = 0; t < 4; ++t) {
    producers.emplace_back([&] {
      for (int i = 0; i < 500; ++i) {
        if (i % 5 == 0) {
          queue->sync(body);
        } else {
          queue->async(body);
        }
      }
    });
  }
  for (auto& t : producers) t.join();
  std::promise<void> flushed;
  queue->async([&] { flushed.set_value(); });
  flushed.get_future().wait();
  EXPECT_FALSE(overlapped);
  EXPECT_EQ(done.load(), 2000);
}

TEST(SerialQueue, ContinuationRunsOnTheHandlersThreadOnceItReturns) {
  QueuePool pool(2);
  auto queue = SerialQueue::make("continuation", pool.context());
  struct Seen {
    std::thread::id thread;
    bool handlerReturned = false;
  };
  std::atomic<bool> handlerReturned{false};
  std::promise<std::thread::id> handlerThread;
  std::promise<Seen> continued;
  asio::post(pool.context(), [&] {
    handlerThread.set_value(std::this_thread::get_id());
    queue->asyncContinuation([&] {
      continued.set_value({std::this_thread::get_id(), handlerReturned.load()});
    });
    // Long enough for the pool's other, idle thread to take a posted block first.
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    handlerReturned = true;
  });
  Seen seen = continued.get_future().get();
  EXPECT_EQ(seen.thread, handlerThread.get_future().get());
  EXPECT_TRUE(seen.handlerReturned);

  // From a thread outside the context it is async: run by the pool, in order with the rest.
  std::vector<int> order;
  std::promise<void> done;
  queue->async([&] { order.push_back(1); });
  queue->asyncContinuation([&] { order.push_back(2); });
  queue->async([&] {
    order.push_back(3);
    done.set_value();
  });
  done.get_future().wait();
  EXPECT_EQ(order, (std::vector<int>{1, 2, 3}));
}

TEST(SerialQueue, SyncRunsOnTheCallerAfterEarlierBlocks) {
  QueuePool pool(2);
  auto queue = SerialQueue::make("sync", pool.context());
  std::vector<int> seen;
  queue->async([&] {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    seen.push_back(1);
  });
  std::thread::id ranOn;
  queue->sync([&] {
    seen.push_back(2);
    ranOn = std::this_thread::get_id();
    EXPECT_TRUE(queue->isCurrent());
  });
  EXPECT_EQ(ranOn, std::this_thread::get_id());
  EXPECT_EQ(seen, (std::vector<int>{1, 2}));
  EXPECT_FALSE(queue->isCurrent());
}

TEST(SerialQueue, KnowsWhichQueueIsCurrentAcrossNesting) {
  QueuePool pool(2);
  auto outer = SerialQueue::make("outer", pool.context());
  auto inner = SerialQueue::make("inner", pool.context());
  std::promise<std::tuple<bool, bool, std::string>> result;
  outer->async([&] {
    inner->sync([&] {
      result.set_value({outer->isCurrent(), inner->isCurrent(), SerialQueue::currentLabel()});
    });
  });
  auto [outerCurrent, innerCurrent, label] = result.get_future().get();
  EXPECT_TRUE(outerCurrent);
  EXPECT_TRUE(innerCurrent);
  EXPECT_EQ(label, "inner");
}

TEST(SerialQueueDeathTest, SyncIntoTheCurrentQueueAborts) {
  EXPECT_DEATH(
      {
        QueuePool pool(1);
        auto queue = SerialQueue::make("self", pool.context());
        queue->sync([&] { queue->sync([] {}); });
      },
      "re-entered queue \"self\"");
}

}  // namespace
}  // namespace ek
