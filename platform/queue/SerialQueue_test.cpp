#include "platform/queue/SerialQueue.h"

#include <gtest/gtest.h>

#include <asio/post.hpp>

#include <atomic>
#include <future>
#include <thread>
#include <vector>

namespace ek {
namespace {

using namespace std::chrono_literals;

TEST(SerialQueue, RunsBlocksOneAtATimeInTheOrderGiven) {
  QueuePool pool(4);
  auto queue = SerialQueue::make("exclusive", pool.context());
  std::atomic<int> inside{0};
  std::atomic<bool> overlapped{false};
  std::vector<std::vector<int>> seen(3);  // per producer, touched only inside the queue
  std::vector<std::jthread> producers;
  for (int p = 0; p < 3; ++p) {
    producers.emplace_back([&, p] {
      for (int i = 0; i < 300; ++i) {
        auto block = [&, p, i] {
          if (inside.fetch_add(1) != 0) overlapped = true;
          seen[p].push_back(i);
          inside.fetch_sub(1);
        };
        if (i % 5 == 0) {
          queue->sync(block);
        } else {
          queue->async(block);
        }
      }
    });
  }
  producers.clear();
  queue->sync([] {});
  EXPECT_FALSE(overlapped);
  for (const auto& blocks : seen) {
    ASSERT_EQ(blocks.size(), 300u);
    for (int i = 0; i < 300; ++i) EXPECT_EQ(blocks[i], i);
  }
}

TEST(SerialQueue, SyncWaitsItsTurnOnTheCallersThreadAndCountsAsWaiting) {
  QueuePool pool(2);
  auto queue = SerialQueue::make("sync", pool.context());
  std::vector<int> order;
  std::promise<void> started;
  EXPECT_FALSE(queue->hasWaiting());
  queue->async([&] {
    started.set_value();
    // Runs on until the caller of sync below waits behind it.
    for (int i = 0; i < 100000000 && !queue->hasWaiting(); ++i) std::this_thread::yield();
    order.push_back(1);
  });
  started.get_future().wait();
  EXPECT_FALSE(queue->hasWaiting());  // the running block does not count
  std::thread::id ranOn;
  queue->sync([&] {
    order.push_back(2);
    ranOn = std::this_thread::get_id();
    EXPECT_TRUE(queue->isCurrent());
  });
  EXPECT_EQ(order, (std::vector<int>{1, 2}));
  EXPECT_EQ(ranOn, std::this_thread::get_id());
  EXPECT_FALSE(queue->isCurrent());
}

TEST(SerialQueue, ContinuationRunsOnTheHandlersThreadOnceItReturns) {
  QueuePool pool(2);
  auto queue = SerialQueue::make("continuation", pool.context());
  std::promise<std::thread::id> handler, continued;
  auto continuation = continued.get_future();
  asio::post(pool.context(), [&] {
    queue->asyncContinuation([&] { continued.set_value(std::this_thread::get_id()); });
    // The pool's other thread is idle: a continuation posted like any block would run now.
    EXPECT_EQ(continuation.wait_for(50ms), std::future_status::timeout);
    handler.set_value(std::this_thread::get_id());
  });
  EXPECT_EQ(handler.get_future().get(), continuation.get());
}

TEST(SerialQueue, KnowsWhichQueuesAreCurrentAcrossNesting) {
  QueuePool pool(2);
  auto outer = SerialQueue::make("outer", pool.context());
  auto inner = SerialQueue::make("inner", pool.context());
  std::promise<std::tuple<bool, bool, std::string>> result;
  outer->async([&] {
    inner->sync([&] {
      result.set_value({outer->isCurrent(), inner->isCurrent(), SerialQueue::currentLabel()});
    });
  });
  EXPECT_EQ(result.get_future().get(), std::make_tuple(true, true, std::string("inner")));
  EXPECT_EQ(SerialQueue::currentLabel(), "");
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
