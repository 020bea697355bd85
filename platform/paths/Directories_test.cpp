#include "platform/paths/Directories.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>

#include "platform/testing/Files.h"

namespace ek::paths {
namespace {

TEST(Paths, EnvironmentOverridesTheDefaultsOfEachUser) {
  const char* const kVariables[] = {"EKORA_RUNTIME_DIR", "EKORA_STATE_DIR", "EKORA_SYSTEM_ROOT",
                                    "XDG_RUNTIME_DIR",   "XDG_STATE_HOME",  "HOME"};
  const struct {
    uid_t uid;
    std::vector<const char*> environment;  // name, value, ...
    const char* runtime;
    const char* state;
  } cases[] = {
      {0, {"XDG_RUNTIME_DIR", "/run/user/0", "HOME", "/root"}, "/run/ekora", "/var/lib/ekora"},
      {65534,
       {"XDG_RUNTIME_DIR", "/run/user/65534", "XDG_STATE_HOME", "/home/n/state"},
       "/run/user/65534/ekora",
       "/home/n/state/ekora"},
      {65534,
       {"XDG_RUNTIME_DIR", "run", "XDG_STATE_HOME", "relative", "HOME", "/home/n"},
       "/tmp/ekora-65534",
       "/home/n/.local/state/ekora"},
      {0,
       {"EKORA_RUNTIME_DIR", "/tmp/rt", "EKORA_STATE_DIR", "/tmp/st", "EKORA_SYSTEM_ROOT", ""},
       "/tmp/rt",
       "/tmp/st"},
  };
  for (const auto& c : cases) {
    for (const char* name : kVariables) unsetenv(name);
    for (size_t i = 0; i < c.environment.size(); i += 2) {
      setenv(c.environment[i], c.environment[i + 1], 1);
    }
    EXPECT_EQ(runtimeDir(c.uid), c.runtime) << c.uid;
    EXPECT_EQ(stateDir(c.uid), c.state) << c.uid;
    EXPECT_EQ(systemRoot(), "/usr/lib/ekora");  // an empty variable counts as unset
  }
  EXPECT_EQ(runtimeDir(), "/tmp/rt");
  EXPECT_EQ(servicePath("com.corvane.ekd"), "/tmp/rt/com.corvane.ekd");
  EXPECT_EQ(notificationsDir(), "/tmp/rt/notifications");
  for (const char* name : kVariables) unsetenv(name);
}

TEST(Paths, JoinUsesExactlyOneSlash) {
  const char* const cases[][3] = {
      {"/run/ekora//", "//x/y", "/run/ekora/x/y"},
      {"/", "x", "/x"},
      {"", "x", "x"},
      {"a", "", "a"},
      {"a", "b/", "a/b/"},
  };
  for (const auto& c : cases) EXPECT_EQ(join(c[0], c[1]), c[2]) << c[0] << " + " << c[1];
}

TEST(Paths, EnsureDirectoryMakesMissingParentsWithTheMode) {
  testing::TempDir root;
  mode_t old = umask(0);
  ASSERT_TRUE(ensureDirectory(root.file("a/b/c"), 0750).ok());
  umask(old);
  struct stat st {};
  ASSERT_EQ(stat(root.file("a").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0750u);
  EXPECT_TRUE(ensureDirectory(root.file("a/b/c/")).ok());
  ASSERT_EQ(symlink(root.file("a").c_str(), root.file("link").c_str()), 0);
  EXPECT_TRUE(ensureDirectory(root.file("link/inner")).ok());
  EXPECT_TRUE(std::filesystem::is_directory(root.file("a/inner")));
  ASSERT_TRUE(testing::writeFile(root.file("file"), ""));
  for (const char* path : {"file", "file/child"}) {
    EXPECT_TRUE(ensureDirectory(root.file(path)).error().isPosix(ENOTDIR)) << path;
  }
  EXPECT_FALSE(ensureDirectory("").ok());
}

}  // namespace
}  // namespace ek::paths
