// The daemon's registry on disk: system plug-ins are registered at start-up and the registry
// survives restarts and corruption.
#include <gtest/gtest.h>

#include <chrono>
#include <fstream>
#include <thread>

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

// Whether ekctl finds the plug-in at path within ten seconds (present) or stops finding it.
bool becomes(const EkdProcess& daemon, const fs::path& path, bool present) {
  for (int i = 0; i < 100; ++i) {
    if ((daemon.ekctl({"info", path.string()}).status == 0) == present) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
  }
  return false;
}

TEST(DaemonRegistry, SystemVolumeIsFollowedWhileRunning) {
  EkdProcess daemon;
  fs::path plugIns = daemon.root().path() / "System/Library/PlugIns";
  fs::create_directories(plugIns);
  ASSERT_TRUE(daemon.start()) << daemon.log();
  fs::path bundle = plugIns / "SpellCheck.bundle";
  fs::copy(fs::path(EXAMPLES_DIR) / "System/Library/PlugIns/SpellCheck.bundle",
           daemon.root().path() / "staged", fs::copy_options::recursive);
  fs::rename(daemon.root().path() / "staged", bundle);
  EXPECT_TRUE(becomes(daemon, bundle, true)) << daemon.log();
  auto status = daemon.ekctl({"status", "-o", "json"});
  ASSERT_EQ(status.status, 0) << status.err;
  EXPECT_NE(status.out.find("\"plugins\": 1,"), std::string::npos) << status.out;
  EXPECT_NE(status.out.find("\"pid\": " + std::to_string(daemon.pid())), std::string::npos);

  fs::remove_all(bundle);
  EXPECT_TRUE(becomes(daemon, bundle, false)) << daemon.log();
  // A rescan asked for (SIGHUP) leaves the daemon serving.
  EXPECT_EQ(daemon.ekctl({"rescan"}).status, 0);
  EXPECT_TRUE(answers(daemon));
  EXPECT_EQ(daemon.terminate(), 0);
}

// The system volume is registered once the daemon serves: requests meanwhile see the
// bundles registered so far, and every one is found once the scan is done.
TEST(DaemonRegistry, AnswersWhileTheSystemVolumeIsRegistered) {
  constexpr uint64_t kBundles = 3000;
  EkdProcess daemon;
  daemon.setEnvironment("EKORA_LOG", "default");
  fs::path plugIns = daemon.root().path() / "System/Library/PlugIns";
  std::vector<std::string> bundles;
  for (uint64_t i = 0; i < kBundles; ++i) {
    bundles.push_back((plugIns / ("P" + std::to_string(10000 + i) + ".bundle")).string());
    fs::create_directories(bundles.back());
    std::ofstream(bundles.back() + "/Info.dmap")
        << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<dmap version=\"1.0\">\n<dict>\n"
        << "<key>QvBundleIdentifier</key><string>com.example.p" << i << "</string>\n"
        << "<key>ZuExtension</key><dict><key>ZuExtensionAttributes</key><dict></dict>"
        << "<key>ZuExtensionPointIdentifier</key><string>com.example.scale</string>"
        << "<key>ZuExtensionProtocol</key><string>Scale</string></dict>\n</dict>\n</dmap>\n";
  }
  ASSERT_TRUE(daemon.startServing()) << daemon.log();
  auto first = daemon.ask(request("status"));
  ASSERT_TRUE(first);
  // The start line is written as the daemon begins to serve, before the scan begins.
  EXPECT_TRUE(daemon.logShows("0 plug-ins registered"));
  ASSERT_NE(first->get("scanning"), nullptr);
  EXPECT_TRUE(*first->get("scanning")->boolean()) << first->description();
  EXPECT_LT(*first->getUnsigned("plugins"), kBundles);

  std::optional<Value> status;
  for (int i = 0; i < 3000; ++i) {
    status = daemon.ask(request("status"));
    if (!status || !*status->get("scanning")->boolean()) break;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  ASSERT_TRUE(status && !*status->get("scanning")->boolean());
  EXPECT_EQ(*status->getUnsigned("plugins"), kBundles);
  EXPECT_TRUE(daemon.logShows("3000 bundles, 3000 read, 0 unchanged; 3000 plug-ins registered"));
  RawClient client(daemon.socketPath());
  uint64_t found = 0;
  for (uint64_t i = 0; i < kBundles; ++i) {
    ASSERT_TRUE(
        client.sendMessage(request("find", {{"paths", Value("file://" + bundles[i])}}), i + 1));
    auto reply = client.readFrame();
    ASSERT_TRUE(reply);
    const Value* form = reply->body.get("matches");
    found += form && form->getString("path") && *form->getString("path") == bundles[i];
  }
  EXPECT_EQ(found, kBundles);
  EXPECT_EQ(daemon.terminate(), 0);
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
