#include "platform/paths/Directories.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>

namespace ek::paths {
namespace {

TEST(Paths, EnvironmentOverridesTheDefaultsOfEachUser) {
  const char* const kVariables[] = {"EKORA_RUNTIME_DIR", "EKORA_STATE_DIR", "EKORA_SYSTEM_ROOT",
                                    "XDG_RUNTIME_DIR",   "XDG_STATE_HOME",  "HOME"};
  // For a user and an environment (name, value, ...): the runtime and state directories.
  const std::tuple<uid_t, std::vector<const char*>, const char*, const char*> cases[] = {
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
  for (const auto& [uid, environment, runtime, state] : cases) {
    for (const char* name : kVariables) unsetenv(name);
    for (size_t i = 0; i < environment.size(); i += 2)
      setenv(environment[i], environment[i + 1], 1);
    EXPECT_EQ(runtimeDir(uid), runtime) << uid;
    EXPECT_EQ(stateDir(uid), state) << uid;
    EXPECT_EQ(systemRoot(), "/usr/lib/ekora");  // an empty variable counts as unset
  }
  EXPECT_EQ(runtimeDir(), "/tmp/rt");
  EXPECT_EQ(servicePath("com.corvane.ekd"), "/tmp/rt/com.corvane.ekd");
  EXPECT_EQ(notificationsDir(), "/tmp/rt/notifications");
  EXPECT_EQ(join("/run/ekora//", "//x/"), "/run/ekora/x/");
  EXPECT_EQ(join("/", "x"), "/x");
  // A parent in the way is not a directory.
  EXPECT_TRUE(ensureDirectory("/dev/null/x").error().isPosix(ENOTDIR));
  for (const char* name : kVariables) unsetenv(name);
}

}  // namespace
}  // namespace ek::paths
