// The daemon's registry on disk: system plug-ins are registered at start-up and the registry
// survives restarts and corruption.
#include <gtest/gtest.h>

#include <fstream>

#include "platform/vantor/SqliteRegistry.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;

std::shared_ptr<vantor::SqliteRegistry> openStopped(const EkdProcess& daemon) {
  vantor::SqliteRegistry::Options options;
  options.stateDir = (daemon.root().path() / "state").string();
  options.databasePath = options.stateDir + "/registry.db";
  options.systemRoot = (daemon.root().path() / "System").string();
  options.scanOnOpen = false;
  auto registry = vantor::SqliteRegistry::open(options);
  EXPECT_TRUE(registry.ok()) << (registry.ok() ? "" : registry.error().message);
  return registry.ok() ? registry.value() : nullptr;
}

void installExampleSystem(const EkdProcess& daemon) {
  fs::copy(fs::path(EXAMPLES_DIR) / "System", daemon.root().path() / "System",
           fs::copy_options::recursive | fs::copy_options::overwrite_existing);
}

bool answers(const EkdProcess& daemon) {
  RawClient client(daemon.socketPath());
  return client.sendMessage(request("Nope"), 1) && client.readFrame().has_value();
}

TEST(DaemonRegistry, SystemPlugInsAreRegisteredAtStartAndForgottenWhenRemoved) {
  EkdProcess daemon;
  installExampleSystem(daemon);
  ASSERT_TRUE(daemon.start()) << daemon.log();
  ASSERT_EQ(daemon.terminate(), 0);
  {
    auto registry = openStopped(daemon);
    ASSERT_TRUE(registry);
    auto plugIn = registry->plugInByUrl(
        (daemon.root().path() / "System/Library/PlugIns/SpellCheck.bundle").string());
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(plugIn->identifier, "com.corvane.spellcheck");
    EXPECT_TRUE(fs::is_directory(daemon.root().path() / "state/containers/com.corvane.spellcheck"));
  }
  fs::remove_all(daemon.root().path() / "System/Library/PlugIns/SpellCheck.bundle");
  ASSERT_TRUE(daemon.start()) << daemon.log();
  ASSERT_EQ(daemon.terminate(), 0);
  auto registry = openStopped(daemon);
  ASSERT_TRUE(registry);
  EXPECT_TRUE(registry->installedPlugIns().empty());
}

TEST(DaemonRegistry, CorruptRegistryIsSetAsideAndRebuilt) {
  EkdProcess daemon;
  installExampleSystem(daemon);
  fs::path db = daemon.root().path() / "state/registry.db";
  std::ofstream(db) << "this is not a database, but someone may want to read it";
  ASSERT_TRUE(daemon.start()) << daemon.log();
  EXPECT_TRUE(answers(daemon));
  ASSERT_EQ(daemon.terminate(), 0);
  bool setAside = false;
  for (const auto& entry : fs::directory_iterator(daemon.root().path() / "state")) {
    setAside |= entry.path().filename().string().rfind("registry.db.corrupt-", 0) == 0;
  }
  EXPECT_TRUE(setAside);
  auto registry = openStopped(daemon);
  ASSERT_TRUE(registry);
  EXPECT_EQ(registry->installedPlugIns().size(), 1u);
}

}  // namespace
}  // namespace ek::test
