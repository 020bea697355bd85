#include "platform/paths/Directories.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <functional>
#include <map>
#include <optional>

namespace ek::paths {
namespace {

const char* const kVariables[] = {"EKORA_RUNTIME_DIR", "EKORA_STATE_DIR", "EKORA_SYSTEM_ROOT",
                                  "XDG_RUNTIME_DIR",   "XDG_STATE_HOME",  "HOME"};

// Saves the variables the functions read and restores them afterwards.
class PathsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    for (const char* name : kVariables) {
      if (const char* value = std::getenv(name)) saved_[name] = value;
      unsetenv(name);
    }
  }
  void TearDown() override {
    for (const char* name : kVariables) {
      auto it = saved_.find(name);
      if (it == saved_.end()) {
        unsetenv(name);
      } else {
        setenv(name, it->second.c_str(), 1);
      }
    }
  }
  std::map<std::string, std::string> saved_;
};

// Runs body in a child process under another user and answers what it printed.
std::optional<std::string> runAs(uid_t uid, const std::function<std::string()>& body) {
  int fds[2];
  if (pipe(fds) != 0) return std::nullopt;
  pid_t child = fork();
  if (child == 0) {
    close(fds[0]);
    if (setresgid(uid, uid, uid) != 0 || setresuid(uid, uid, uid) != 0) _exit(3);
    std::string text = body();
    ssize_t written = write(fds[1], text.data(), text.size());
    _exit(written == ssize_t(text.size()) ? 0 : 4);
  }
  close(fds[1]);
  std::string text;
  char buffer[512];
  ssize_t n;
  while ((n = read(fds[0], buffer, sizeof buffer)) > 0) text.append(buffer, size_t(n));
  close(fds[0]);
  int status = 0;
  waitpid(child, &status, 0);
  if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) return std::nullopt;
  return text;
}

TEST_F(PathsTest, EnvironmentOverridesEveryDefault) {
  setenv("EKORA_RUNTIME_DIR", "/tmp/rt", 1);
  setenv("EKORA_STATE_DIR", "/tmp/st", 1);
  setenv("EKORA_SYSTEM_ROOT", "/tmp/sys", 1);
  EXPECT_EQ(runtimeDir(), "/tmp/rt");
  EXPECT_EQ(stateDir(), "/tmp/st");
  EXPECT_EQ(systemRoot(), "/tmp/sys");
  EXPECT_EQ(servicePath("com.corvane.ekd"), "/tmp/rt/com.corvane.ekd");
  EXPECT_EQ(notificationsDir(), "/tmp/rt/notifications");
}

TEST_F(PathsTest, EmptyVariableMeansUnset) {
  setenv("EKORA_SYSTEM_ROOT", "", 1);
  EXPECT_EQ(systemRoot(), "/usr/lib/ekora");
}

TEST_F(PathsTest, RootDefaults) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root";
  setenv("XDG_RUNTIME_DIR", "/run/user/0", 1);
  EXPECT_EQ(runtimeDir(), "/run/ekora");
  EXPECT_EQ(stateDir(), "/var/lib/ekora");
  EXPECT_EQ(systemRoot(), "/usr/lib/ekora");
  EXPECT_EQ(servicePath("x"), "/run/ekora/x");
}

TEST_F(PathsTest, OtherUserDefaultsFollowXdg) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to switch user";
  setenv("XDG_RUNTIME_DIR", "/run/user/65534", 1);
  setenv("XDG_STATE_HOME", "/home/nobody/state", 1);
  auto text = runAs(65534, [] { return runtimeDir() + "|" + stateDir() + "|" + systemRoot(); });
  ASSERT_TRUE(text);
  EXPECT_EQ(*text, "/run/user/65534/ekora|/home/nobody/state/ekora|/usr/lib/ekora");
}

TEST_F(PathsTest, OtherUserFallbacksWithoutXdg) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to switch user";
  setenv("HOME", "/home/nobody", 1);
  setenv("XDG_STATE_HOME", "relative/ignored", 1);
  auto text = runAs(65534, [] { return runtimeDir() + "|" + stateDir(); });
  ASSERT_TRUE(text);
  EXPECT_EQ(*text, "/tmp/ekora-65534|/home/nobody/.local/state/ekora");
}

TEST(Join, UsesExactlyOneSlash) {
  struct Case {
    const char* a;
    const char* b;
    const char* joined;
  };
  const Case cases[] = {
      {"/run/ekora", "x", "/run/ekora/x"},
      {"/run/ekora/", "x", "/run/ekora/x"},
      {"/run/ekora", "/x", "/run/ekora/x"},
      {"/run/ekora//", "//x/y", "/run/ekora/x/y"},
      {"/", "x", "/x"},
      {"", "x", "x"},
      {"a", "", "a"},
      {"a", "b/", "a/b/"},
  };
  for (const auto& c : cases) EXPECT_EQ(join(c.a, c.b), c.joined) << c.a << " + " << c.b;
}

class EnsureDirectoryTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (std::filesystem::temp_directory_path() / "ekpaths.XXXXXX").string();
    ASSERT_NE(mkdtemp(pattern.data()), nullptr);
    root_ = pattern;
  }
  void TearDown() override { std::filesystem::remove_all(root_); }
  std::string root_;
};

TEST_F(EnsureDirectoryTest, CreatesMissingParentsWithMode) {
  mode_t old = umask(0);
  std::string path = root_ + "/a/b/c";
  auto result = ensureDirectory(path, 0750);
  umask(old);
  ASSERT_TRUE(result.ok()) << result.error().message;
  struct stat st {};
  ASSERT_EQ(stat(path.c_str(), &st), 0);
  EXPECT_TRUE(S_ISDIR(st.st_mode));
  EXPECT_EQ(st.st_mode & 07777, 0750u);
  ASSERT_EQ(stat((root_ + "/a").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0750u);
}

TEST_F(EnsureDirectoryTest, ExistingDirectoryIsFine) {
  ASSERT_TRUE(ensureDirectory(root_ + "/x/").ok());
  EXPECT_TRUE(ensureDirectory(root_ + "/x").ok());
  EXPECT_TRUE(ensureDirectory(root_).ok());
}

TEST_F(EnsureDirectoryTest, FileInTheWayIsAnError) {
  std::string file = root_ + "/file";
  int fd = open(file.c_str(), O_CREAT | O_WRONLY, 0644);
  ASSERT_GE(fd, 0);
  close(fd);
  auto direct = ensureDirectory(file);
  ASSERT_FALSE(direct.ok());
  EXPECT_TRUE(direct.error().isPosix(ENOTDIR)) << direct.error().message;
  auto below = ensureDirectory(file + "/child");
  ASSERT_FALSE(below.ok());
  EXPECT_TRUE(below.error().isPosix(ENOTDIR)) << below.error().message;
}

TEST_F(EnsureDirectoryTest, SymlinkToDirectoryCounts) {
  ASSERT_TRUE(ensureDirectory(root_ + "/real").ok());
  ASSERT_EQ(symlink((root_ + "/real").c_str(), (root_ + "/link").c_str()), 0);
  EXPECT_TRUE(ensureDirectory(root_ + "/link/inner").ok());
  EXPECT_TRUE(std::filesystem::is_directory(root_ + "/real/inner"));
}

TEST_F(EnsureDirectoryTest, EmptyPathIsAnError) {
  EXPECT_FALSE(ensureDirectory("").ok());
}

}  // namespace
}  // namespace ek::paths
