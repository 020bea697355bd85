#include "ekd/EkDSystemVolumeWatch.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <optional>
#include <thread>

#include "platform/testing/Files.h"

namespace ek {
namespace {

using namespace std::chrono_literals;

class SystemVolumeWatchTest : public ::testing::Test {
 protected:
  void SetUp() override {
    guard_.emplace(context_.get_executor());
    thread_ = std::thread([this] { context_.run(); });
  }
  void TearDown() override {
    if (watch_) watch_->cancel();
    guard_.reset();
    context_.stop();
    thread_.join();
  }
  void makeWatch(const std::string& directory) {
    auto made = EkDSystemVolumeWatch::make(context_, directory, 100ms, [this] { ++rescans_; });
    ASSERT_TRUE(made.ok()) << made.error().message;
    watch_ = std::move(made).value();
  }
  // The rescans once at least `least` have come (waiting up to ten seconds) and then none
  // for half a second (waiting up to fifty).
  int settledRescans(int least) {
    for (int i = 0; i < 1000 && rescans_ < least; ++i) std::this_thread::sleep_for(10ms);
    for (int i = 0, last = -1; i < 100 && rescans_ != last; ++i) {
      last = rescans_;
      std::this_thread::sleep_for(500ms);
    }
    return rescans_;
  }

  testing::TempDir temp_;
  std::filesystem::path dir_ = temp_.path();
  asio::io_context context_;
  std::optional<asio::executor_work_guard<asio::io_context::executor_type>> guard_;
  std::thread thread_;
  std::shared_ptr<EkDSystemVolumeWatch> watch_;
  std::atomic<int> rescans_{0};
};

TEST_F(SystemVolumeWatchTest, ABurstOfBundlesIsOneRescanAndQuietIsNone) {
  makeWatch(dir_);
  EXPECT_TRUE(watch_->watching());
  EXPECT_EQ(settledRescans(0), 0);
  for (int i = 0; i < 20; ++i) {
    ASSERT_EQ(mkdir((dir_ / ("B" + std::to_string(i) + ".bundle")).c_str(), 0755), 0);
  }
  EXPECT_EQ(settledRescans(1), 1);
  std::filesystem::rename(dir_ / "B0.bundle", dir_ / "C.bundle");
  std::filesystem::remove(dir_ / "B1.bundle");
  EXPECT_EQ(settledRescans(2), 2);
}

TEST_F(SystemVolumeWatchTest, AMissingDirectoryStillRescansWhenAsked) {
  makeWatch((dir_ / "absent").string());
  EXPECT_FALSE(watch_->watching());
  watch_->requestRescan();
  EXPECT_EQ(settledRescans(1), 1);
}

}  // namespace
}  // namespace ek
