#include "platform/notify/Notifications.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

namespace ek::notify {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using Entries = std::vector<std::pair<std::string, uint64_t>>;

class NotificationsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "ek-notify-XXXXXX").string();
    ASSERT_NE(mkdtemp(pattern.data()), nullptr);
    root_ = pattern;
    dir_ = (root_ / "runtime" / "notifications").string();
  }
  void TearDown() override {
    std::error_code ignored;
    fs::remove_all(root_, ignored);
  }

  std::string contents(const std::string& name) const {
    std::ifstream in(fs::path(dir_) / name, std::ios::binary);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
  }
  void writeFile(const std::string& name, const std::string& text) const {
    fs::create_directories(dir_);
    std::ofstream(fs::path(dir_) / name, std::ios::binary) << text;
  }

  fs::path root_;
  std::string dir_;
};

TEST_F(NotificationsTest, PostIncrementsGenerationAndWritesDecimalText) {
  for (uint64_t expected = 1; expected <= 3; ++expected) {
    auto generation = post("foo", dir_);
    ASSERT_TRUE(generation.ok()) << generation.error().message;
    EXPECT_EQ(*generation, expected);
    EXPECT_EQ(contents("foo"), std::to_string(expected));
    EXPECT_EQ(notify::generation("foo", dir_), expected);
  }
  EXPECT_EQ(notify::generation("bar", dir_), 0u);
}

TEST_F(NotificationsTest, PostCreatesDirectoryAndFilesWithExactModes) {
  mode_t old = umask(077);
  auto generation = post("foo", dir_);
  umask(old);
  ASSERT_TRUE(generation.ok()) << generation.error().message;
  struct stat st {};
  ASSERT_EQ(stat(dir_.c_str(), &st), 0);
  EXPECT_TRUE(S_ISDIR(st.st_mode));
  EXPECT_EQ(st.st_mode & 07777, 0755u);
  ASSERT_EQ(stat((fs::path(dir_) / "foo").c_str(), &st), 0);
  EXPECT_TRUE(S_ISREG(st.st_mode));
  EXPECT_EQ(st.st_mode & 07777, 0644u);
}

TEST_F(NotificationsTest, PostLeavesOnlyTheNotificationFile) {
  ASSERT_TRUE(post("foo", dir_).ok());
  ASSERT_TRUE(post("foo", dir_).ok());
  std::vector<std::string> names;
  for (const auto& entry : fs::directory_iterator(dir_)) {
    names.push_back(entry.path().filename());
  }
  EXPECT_EQ(names, std::vector<std::string>{"foo"});
}

TEST_F(NotificationsTest, UnreadableFilesReadAsGenerationZero) {
  struct Case {
    std::string text;
    const char* why;
  };
  const Case cases[] = {
      {"", "empty"},
      {"abc", "not a number"},
      {"12x", "trailing garbage"},
      {"-5", "negative"},
      {" 7", "leading space"},
      {"99999999999999999999999", "beyond 64 bits"},
      {std::string(33, '1'), "longer than 32 bytes"},
      {std::string(4096, '7'), "far too long"},
  };
  for (const auto& c : cases) {
    writeFile("bad", c.text);
    EXPECT_EQ(generation("bad", dir_), 0u) << c.why;
    auto next = post("bad", dir_);
    ASSERT_TRUE(next.ok()) << c.why;
    EXPECT_EQ(*next, 1u) << c.why;
  }
}

TEST_F(NotificationsTest, GenerationOfMissingFileOrDirectoryIsZero) {
  EXPECT_EQ(generation("foo", dir_), 0u);
  fs::create_directories(dir_);
  EXPECT_EQ(generation("foo", dir_), 0u);
}

TEST_F(NotificationsTest, ExistingGenerationIsContinued) {
  writeFile("foo", "41");
  EXPECT_EQ(generation("foo", dir_), 41u);
  auto next = post("foo", dir_);
  ASSERT_TRUE(next.ok());
  EXPECT_EQ(*next, 42u);
}

TEST_F(NotificationsTest, FifoUnderTheNameDoesNotBlock) {
  fs::create_directories(dir_);
  ASSERT_EQ(mkfifo((fs::path(dir_) / "pipe").c_str(), 0644), 0);
  EXPECT_EQ(generation("pipe", dir_), 0u);
}

TEST_F(NotificationsTest, InvalidNamesAreRefused) {
  const std::string invalid[] = {
      "", ".", "..", "a/b", "/", std::string("a\0b", 3), std::string(256, 'n'),
  };
  for (const auto& name : invalid) {
    EXPECT_FALSE(checkName(name).ok()) << name;
    EXPECT_FALSE(post(name, dir_).ok()) << name;
    EXPECT_FALSE(Watcher::create({"ok", name}, dir_).ok()) << name;
    EXPECT_EQ(generation(name, dir_), 0u);
  }
  EXPECT_FALSE(fs::exists(dir_ + "/b"));
  EXPECT_FALSE(fs::exists(root_ / "runtime" / "b"));
}

TEST_F(NotificationsTest, ValidNamesAreAccepted) {
  const std::string valid[] = {
      "a", "...", ".hidden", "com.corvane.Ekora.changed", std::string(255, 'n'), "with space"};
  for (const auto& name : valid) {
    EXPECT_TRUE(checkName(name).ok()) << name;
    auto generation = post(name, dir_);
    ASSERT_TRUE(generation.ok()) << name << ": " << generation.error().message;
    EXPECT_EQ(*generation, 1u);
  }
}

TEST_F(NotificationsTest, ConcurrentThreadsNeverLoseAPost) {
  constexpr int kThreads = 8;
  constexpr int kPosts = 50;
  std::vector<std::thread> threads;
  std::atomic<int> failures{0};
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&] {
      uint64_t last = 0;
      for (int i = 0; i < kPosts; ++i) {
        auto generation = post("busy", dir_);
        // Every poster sees its own generations strictly grow.
        if (!generation.ok() || *generation <= last) {
          ++failures;
        } else {
          last = *generation;
        }
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);
  EXPECT_EQ(generation("busy", dir_), static_cast<uint64_t>(kThreads * kPosts));
}

TEST_F(NotificationsTest, ConcurrentProcessesNeverLoseAPost) {
  constexpr int kProcesses = 2;
  constexpr int kPosts = 200;
  ASSERT_TRUE(post("shared", dir_).ok());  // the directory exists before the race starts
  std::vector<pid_t> children;
  for (int p = 0; p < kProcesses; ++p) {
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      for (int i = 0; i < kPosts; ++i) {
        if (!post("shared", dir_).ok()) _exit(1);
      }
      _exit(0);
    }
    children.push_back(pid);
  }
  for (pid_t pid : children) {
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  }
  EXPECT_EQ(generation("shared", dir_), static_cast<uint64_t>(1 + kProcesses * kPosts));
}

TEST_F(NotificationsTest, WatcherSeesOneEventPerPostWithItsGeneration) {
  auto watcher = Watcher::create({"foo"}, dir_);
  ASSERT_TRUE(watcher.ok()) << watcher.error().message;
  for (uint64_t expected = 1; expected <= 3; ++expected) {
    ASSERT_TRUE(post("foo", dir_).ok());
    auto entries = (*watcher)->next(5s);
    ASSERT_TRUE(entries.ok()) << entries.error().message;
    EXPECT_EQ(*entries, (Entries{{"foo", expected}}));
  }
  auto none = (*watcher)->next(0ms);
  ASSERT_TRUE(none.ok());
  EXPECT_TRUE(none->empty());
}

TEST_F(NotificationsTest, WatcherCountsQueuedPostsOnce) {
  auto watcher = Watcher::create({"foo"}, dir_);
  ASSERT_TRUE(watcher.ok());
  for (int i = 0; i < 5; ++i) ASSERT_TRUE(post("foo", dir_).ok());
  Entries all;
  while (all.size() < 5) {
    auto entries = (*watcher)->next(5s);
    ASSERT_TRUE(entries.ok());
    ASSERT_FALSE(entries->empty()) << "missing events after " << all.size();
    all.insert(all.end(), entries->begin(), entries->end());
  }
  // Each post's own generation, once and in order, although the file already says 5.
  EXPECT_EQ(all, (Entries{{"foo", 1}, {"foo", 2}, {"foo", 3}, {"foo", 4}, {"foo", 5}}));
  auto none = (*watcher)->next(0ms);
  ASSERT_TRUE(none.ok());
  EXPECT_TRUE(none->empty());
}

TEST_F(NotificationsTest, WatcherIgnoresOtherNames) {
  auto watcher = Watcher::create({"foo", "bar"}, dir_);
  ASSERT_TRUE(watcher.ok());
  ASSERT_TRUE(post("other", dir_).ok());
  ASSERT_TRUE(post("foobar", dir_).ok());
  auto none = (*watcher)->next(0ms);
  ASSERT_TRUE(none.ok());
  EXPECT_TRUE(none->empty());
  ASSERT_TRUE(post("other", dir_).ok());
  ASSERT_TRUE(post("bar", dir_).ok());
  auto entries = (*watcher)->next(5s);
  ASSERT_TRUE(entries.ok());
  EXPECT_EQ(*entries, (Entries{{"bar", 1}}));
}

TEST_F(NotificationsTest, WatcherTimesOutEmptyWhenNothingIsPosted) {
  auto watcher = Watcher::create({"foo"}, dir_);
  ASSERT_TRUE(watcher.ok());
  auto entries = (*watcher)->next(20ms);
  ASSERT_TRUE(entries.ok());
  EXPECT_TRUE(entries->empty());
}

TEST_F(NotificationsTest, WatcherCreatesMissingDirectory) {
  ASSERT_FALSE(fs::exists(dir_));
  auto watcher = Watcher::create({"foo"}, dir_);
  ASSERT_TRUE(watcher.ok()) << watcher.error().message;
  EXPECT_TRUE(fs::is_directory(dir_));
  EXPECT_GE((*watcher)->fd(), 0);
}

TEST_F(NotificationsTest, WatcherWakesForAPostFromAnotherThread) {
  auto watcher = Watcher::create({"foo"}, dir_);
  ASSERT_TRUE(watcher.ok());
  std::thread poster([&] {
    std::this_thread::sleep_for(20ms);
    ASSERT_TRUE(post("foo", dir_).ok());
  });
  auto entries = (*watcher)->next();  // no timeout: returns only once the post arrives
  poster.join();
  ASSERT_TRUE(entries.ok());
  EXPECT_EQ(*entries, (Entries{{"foo", 1}}));
}

TEST_F(NotificationsTest, WatcherReportsRemovedDirectory) {
  auto watcher = Watcher::create({"foo"}, dir_);
  ASSERT_TRUE(watcher.ok());
  fs::remove_all(dir_);
  auto entries = (*watcher)->next(5s);
  EXPECT_FALSE(entries.ok());
}

TEST_F(NotificationsTest, FileNotifierPostsIntoItsDirectory) {
  FileNotifier notifier(dir_);
  EXPECT_EQ(notifier.directory(), dir_);
  notifier.post("foo");
  notifier.post("foo");
  EXPECT_EQ(generation("foo", dir_), 2u);
}

TEST_F(NotificationsTest, FileNotifierDefaultsToTheRuntimeDirectory) {
  const char* old = std::getenv("EKORA_RUNTIME_DIR");
  std::string saved = old ? old : "";
  setenv("EKORA_RUNTIME_DIR", (root_ / "runtime").c_str(), 1);
  FileNotifier notifier;
  notifier.post("foo");
  EXPECT_EQ(notifier.directory(), dir_);
  EXPECT_EQ(generation("foo"), 1u);
  if (old) {
    setenv("EKORA_RUNTIME_DIR", saved.c_str(), 1);
  } else {
    unsetenv("EKORA_RUNTIME_DIR");
  }
}

TEST_F(NotificationsTest, FileNotifierSurvivesInvalidNames) {
  FileNotifier notifier(dir_);
  notifier.post("../escape");
  EXPECT_FALSE(fs::exists(root_ / "runtime" / "escape"));
}

TEST(FakeNotifierTest, RecordsAndCountsPosts) {
  FakeNotifier notifier;
  Notifier& seam = notifier;
  seam.post("a");
  seam.post("b");
  seam.post("a");
  EXPECT_EQ(notifier.posts(), (std::vector<std::string>{"a", "b", "a"}));
  EXPECT_EQ(notifier.count("a"), 2u);
  EXPECT_EQ(notifier.count("b"), 1u);
  EXPECT_EQ(notifier.count("c"), 0u);
}

}  // namespace
}  // namespace ek::notify
