#include "platform/notify/Notifications.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <thread>

#include "platform/testing/Files.h"

namespace ek::notify {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using Entries = std::vector<std::pair<std::string, uint64_t>>;

class NotificationsTest : public ::testing::Test {
 protected:
  testing::TempDir root_;
  const std::string dir_ = root_.file("runtime/notifications");
};

TEST_F(NotificationsTest, PostsCountUpInAFileOfTheirOwnNamedByOnePathComponent) {
  mode_t old = umask(077);
  EXPECT_EQ(generation("foo", dir_), 0u);
  for (uint64_t expected = 1; expected <= 3; ++expected)
    EXPECT_EQ(post("foo", dir_).value(), expected);
  umask(old);
  struct stat st {};
  ASSERT_EQ(stat(dir_.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0755u);
  ASSERT_EQ(stat((dir_ + "/foo").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
  EXPECT_EQ(std::distance(fs::directory_iterator(dir_), {}), 1);  // no temporary file left
  // Whatever else the file holds reads as 0.
  for (const std::string& text : {std::string(), std::string("12x"), std::string("-5"),
                                  std::string("99999999999999999999999")}) {
    ASSERT_TRUE(testing::writeFile(dir_ + "/bad", text));
    EXPECT_EQ(generation("bad", dir_), 0u) << text;
    EXPECT_EQ(post("bad", dir_).value(), 1u) << text;
  }
  ASSERT_TRUE(testing::writeFile(dir_ + "/foo", "41"));
  EXPECT_EQ(post("foo", dir_).value(), 42u);
  ASSERT_EQ(mkfifo((dir_ + "/pipe").c_str(), 0644), 0);
  EXPECT_EQ(generation("pipe", dir_), 0u);  // without blocking
  // A name must be one path component.
  for (const std::string& name :
       {std::string(), std::string("."), std::string(".."), std::string("a/b"),
        std::string("a\0b", 3), std::string(256, 'n')}) {
    EXPECT_FALSE(checkName(name).ok()) << name;
    EXPECT_FALSE(post(name, dir_).ok()) << name;
    EXPECT_FALSE(Watcher::create({"ok", name}, dir_).ok()) << name;
  }
  FileNotifier(dir_).post("../escape");  // logged, not posted
  EXPECT_FALSE(fs::exists(root_.file("runtime/escape")));
  EXPECT_EQ(post(std::string(255, '.'), dir_).value(), 1u);
}

TEST_F(NotificationsTest, ConcurrentPostersNeverLoseAPost) {
  std::vector<std::jthread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < 50; ++i) EXPECT_TRUE(post("busy", dir_).ok());
    });
  }
  threads.clear();
  EXPECT_EQ(generation("busy", dir_), 200u);
}

TEST_F(NotificationsTest, WatcherSeesEachPostOfItsNamesOnceWithItsGeneration) {
  auto watcher = Watcher::create({"foo", "bar"}, dir_).value();
  ASSERT_TRUE(post("foo", dir_).ok());
  EXPECT_EQ(watcher->next(5s).value(), (Entries{{"foo", 1}}));
  // Posts that pile up are each reported, although the file already says 4.
  for (int i = 0; i < 3; ++i) ASSERT_TRUE(post("foo", dir_).ok());
  ASSERT_TRUE(post("foobar", dir_).ok());
  Entries all;
  while (all.size() < 3) {
    auto entries = watcher->next(5s).value();
    ASSERT_FALSE(entries.empty()) << all.size();
    all.insert(all.end(), entries.begin(), entries.end());
  }
  EXPECT_EQ(all, (Entries{{"foo", 2}, {"foo", 3}, {"foo", 4}}));
  EXPECT_TRUE(watcher->next(20ms).value().empty());
  // Without a time-out it waits for the next post.
  std::jthread poster([&] { FileNotifier(dir_).post("bar"); });
  EXPECT_EQ(watcher->next().value(), (Entries{{"bar", 1}}));
  fs::remove_all(dir_);
  EXPECT_FALSE(watcher->next(5s).ok());
}

}  // namespace
}  // namespace ek::notify
