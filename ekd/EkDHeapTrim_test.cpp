#include "ekd/EkDHeapTrim.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <asio/executor_work_guard.hpp>
#include <chrono>
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
  void start(Clock::duration quiet) {
    trim_ = EkDHeapTrim::make(context_, quiet, [this] {
      std::lock_guard lock(mutex_);
      trimTimes_.push_back(Clock::now());
    });
    for (int i = 0; i < 2; ++i) threads_.emplace_back([this] { context_.run(); });
  }
  // Whether a trim started at or after since, waiting up to five seconds for one.
  bool trimmedSince(Clock::time_point since) {
    for (auto deadline = Clock::now() + 5s; Clock::now() < deadline;
         std::this_thread::sleep_for(1ms)) {
      std::lock_guard lock(mutex_);
      if (!trimTimes_.empty() && trimTimes_.back() >= since) return true;
    }
    return false;
  }

  asio::io_context context_;
  asio::executor_work_guard<asio::io_context::executor_type> guard_ =
      asio::make_work_guard(context_);
  std::vector<std::thread> threads_;
  std::shared_ptr<EkDHeapTrim> trim_;
  std::mutex mutex_;
  std::vector<Clock::time_point> trimTimes_;
};

TEST_F(EkDHeapTrimTest, ActivityRacingTheTimerIsAlwaysFollowedByATrim) {
  // A short quiet time makes the timer expire in the middle of the threads' activity.
  start(1ms);
  for (int round = 0; round < 5; ++round) {
    std::vector<std::thread> hosts;
    std::vector<Clock::time_point> lastReturns(4);
    for (int i = 0; i < 4; ++i) {
      hosts.emplace_back([&, i] {
        for (int n = 0; n < 2000; ++n) trim_->activity();
        lastReturns[i] = Clock::now();
      });
    }
    for (auto& host : hosts) host.join();
    // A trim starts after the last activity has returned.
    ASSERT_TRUE(trimmedSince(*std::max_element(lastReturns.begin(), lastReturns.end())))
        << "round " << round;
  }
}

}  // namespace
}  // namespace ek
