#include "ekd/EkDHeapTrim.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <asio/executor_work_guard.hpp>
#include <atomic>
#include <chrono>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

namespace ek {
namespace {

using namespace std::chrono_literals;
using Clock = EkDHeapTrim::Clock;

// The daemon's shape: an io context run by two threads, and a trim that records when it ran.
class EkDHeapTrimTest : public ::testing::Test {
 protected:
  void TearDown() override {
    guard_.reset();
    context_.stop();
    for (auto& thread : threads_) thread.join();
  }

  std::shared_ptr<EkDHeapTrim> start(Clock::duration quiet, std::function<void()> duringTrim = {}) {
    auto trim = EkDHeapTrim::make(context_, quiet, [this, duringTrim] {
      {
        std::lock_guard lock(mutex_);
        trimTimes_.push_back(Clock::now());
      }
      if (duringTrim) duringTrim();
    });
    for (int i = 0; i < 2; ++i) threads_.emplace_back([this] { context_.run(); });
    return trim;
  }

  size_t trims() {
    std::lock_guard lock(mutex_);
    return trimTimes_.size();
  }

  // Whether a trim started at or after `since`, waiting up to five seconds for one.
  bool trimmedSince(Clock::time_point since) {
    auto deadline = Clock::now() + 5s;
    while (Clock::now() < deadline) {
      {
        std::lock_guard lock(mutex_);
        if (!trimTimes_.empty() && trimTimes_.back() >= since) return true;
      }
      std::this_thread::sleep_for(1ms);
    }
    return false;
  }

  asio::io_context context_;
  asio::executor_work_guard<asio::io_context::executor_type> guard_ =
      asio::make_work_guard(context_);
  std::vector<std::thread> threads_;
  std::mutex mutex_;
  std::vector<Clock::time_point> trimTimes_;
};

TEST_F(EkDHeapTrimTest, AnIdleDaemonIsNeverWoken) {
  auto trim = start(10ms);
  std::this_thread::sleep_for(100ms);
  EXPECT_EQ(trims(), 0u);
}

TEST_F(EkDHeapTrimTest, TrimsOnceAfterQuietAndAgainAfterNewActivity) {
  auto trim = start(20ms);
  trim->activity();
  ASSERT_TRUE(trimmedSince(Clock::time_point()));
  std::this_thread::sleep_for(200ms);
  EXPECT_EQ(trims(), 1u) << "a quiet daemon was trimmed again and again";

  auto second = Clock::now();
  trim->activity();
  ASSERT_TRUE(trimmedSince(second));
  EXPECT_EQ(trims(), 2u);
}

TEST_F(EkDHeapTrimTest, SteadyActivityPutsTheTrimOff) {
  const auto quiet = 200ms;
  auto trim = start(quiet);
  auto begin = Clock::now();
  auto previous = begin;
  Clock::duration longestGap{};
  while (Clock::now() - begin < 1s) {
    trim->activity();
    auto now = Clock::now();
    longestGap = std::max(longestGap, now - previous);
    previous = now;
    std::this_thread::sleep_for(5ms);
  }
  // Only a machine that stalled this thread for most of the quiet time excuses a trim.
  if (longestGap < quiet / 2) {
    EXPECT_EQ(trims(), 0u);
  }
  ASSERT_TRUE(trimmedSince(previous));
}

TEST_F(EkDHeapTrimTest, ActivityDuringATrimIsFollowedByAnotherTrim) {
  std::shared_ptr<EkDHeapTrim> trim;
  // The first trim sees a request come in while it runs.
  trim = start(5ms, [&] {
    if (trims() == 1) trim->activity();
  });
  trim->activity();
  ASSERT_TRUE(trimmedSince(Clock::time_point()));
  auto deadline = Clock::now() + 5s;
  while (trims() < 2 && Clock::now() < deadline) std::this_thread::sleep_for(1ms);
  EXPECT_EQ(trims(), 2u) << "the request that came in during a trim was never trimmed after";
}

TEST_F(EkDHeapTrimTest, ActivityRacingTheTimerIsAlwaysFollowedByATrim) {
  // A short quiet time makes the timer expire in the middle of the threads' activity.
  auto trim = start(1ms);
  for (int round = 0; round < 20; ++round) {
    std::atomic<bool> go{false};
    std::vector<std::thread> hosts;
    std::vector<Clock::time_point> lastReturns(4);
    for (int i = 0; i < 4; ++i) {
      hosts.emplace_back([&, i] {
        while (!go.load()) std::this_thread::yield();
        for (int n = 0; n < 2000; ++n) {
          trim->activity();
          if (n % 100 == 0) std::this_thread::sleep_for(std::chrono::microseconds(500));
        }
        lastReturns[i] = Clock::now();
      });
    }
    go.store(true);
    for (auto& host : hosts) host.join();
    // A trim starts after the last activity has returned.
    auto last = *std::max_element(lastReturns.begin(), lastReturns.end());
    ASSERT_TRUE(trimmedSince(last)) << "round " << round;
  }
}

}  // namespace
}  // namespace ek
