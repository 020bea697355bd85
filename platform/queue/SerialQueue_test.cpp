#include "platform/queue/SerialQueue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <numeric>
#include <thread>
#include <vector>

namespace ek {
namespace {

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
        i % 5 == 0 ? queue->sync(block) : queue->async(block);
      }
    });
  }
  producers.clear();
  queue->sync([] {});
  EXPECT_FALSE(overlapped);
  std::vector<int> inOrder(300);
  std::iota(inOrder.begin(), inOrder.end(), 0);
  EXPECT_EQ(seen, std::vector<std::vector<int>>(3, inOrder));
}

TEST(SerialQueue, SyncWaitsItsTurnOnTheCallersThreadAndCountsAsWaiting) {
  QueuePool pool(2);
  auto queue = SerialQueue::make("sync", pool.context());
  std::vector<int> order;
  EXPECT_FALSE(queue->hasWaiting());
  queue->async([&] {
    // Runs on until the caller of sync below waits behind it.
    for (int i = 0; i < 100000000 && !queue->hasWaiting(); ++i) std::this_thread::yield();
    order.push_back(1);
  });
  std::thread::id ranOn;
  queue->sync([&] {
    order.push_back(2);
    ranOn = std::this_thread::get_id();
    EXPECT_TRUE(queue->isCurrent());
    EXPECT_EQ(SerialQueue::currentLabel(), "sync");
  });
  EXPECT_EQ(order, (std::vector<int>{1, 2}));
  EXPECT_EQ(ranOn, std::this_thread::get_id());
  EXPECT_FALSE(queue->isCurrent());
}

}  // namespace
}  // namespace ek
