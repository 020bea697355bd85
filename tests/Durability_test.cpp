// An acknowledged annotation is durable: killing the daemon at any moment never loses a change
// it has replied to, and never leaves an annotation file it cannot load.
#include <gtest/gtest.h>

#include <cstdlib>
#include <iostream>
#include <random>
#include <thread>

#include "platform/value/Uuid.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;

struct Target {
  Uuid uuid;
  uint64_t lastSent = 0;   // 0: nothing sent yet
  uint64_t lastAcked = 0;  // 0: nothing acknowledged yet
};

// The "n" of the extension the daemon answers for the plug-in; 0 when there is none.
uint64_t storedN(const EkdProcess& daemon, const Uuid& uuid) {
  auto reply = daemon.ask(request("find", {{"uuids", Value(uuid)}}));
  const Value* form = reply ? reply->get("matches") : nullptr;
  const Value* annotations = form ? form->get("annotations") : nullptr;
  const Value* extension = annotations ? annotations->get("extension") : nullptr;
  const uint64_t* n = extension ? extension->getUnsigned("n") : nullptr;
  return n ? *n : 0;
}

TEST(Durability, AcknowledgedAnnotationsSurviveSigkill) {
  const char* fixed = std::getenv("EKORA_DURABILITY_SEED");
  const uint64_t seed = fixed ? std::strtoull(fixed, nullptr, 10) : std::random_device{}();
  std::cout << "seed " << seed << " (set EKORA_DURABILITY_SEED to repeat the kill delays)\n";
  std::mt19937_64 random(seed);

  EkdProcess daemon;
  daemon.setEnvironment("EKORA_LOG", "default");
  const fs::path app = fs::canonical(daemon.root().path()) / "Viewer.app";
  fs::copy(fs::path(EXAMPLES_DIR) / "Applications/Viewer.app", app, fs::copy_options::recursive);
  ASSERT_TRUE(daemon.start()) << daemon.log();
  auto added = daemon.ask(request("add", {{"paths", Value(Array{Value(app.string())})}}));
  ASSERT_TRUE(added && replyErrorCode(*added) == 0) << daemon.log();
  std::vector<Target> targets;
  for (const char* bundle : {"/PlugIns/Thumbs.appex", "/PlugIns/Share.appex"}) {
    auto reply = daemon.ask(request("find", {{"paths", Value("file://" + app.string() + bundle)}}));
    const Value* form = reply ? reply->get("matches") : nullptr;
    ASSERT_TRUE(form && form->getString("uuid")) << bundle << "\n" << daemon.log();
    targets.push_back({*Uuid::parse(*form->getString("uuid"))});
  }

  uint64_t next = 0, acknowledged = 0;
  for (int round = 0; round < 100; ++round) {
    SCOPED_TRACE("round " + std::to_string(round) + ", seed " + std::to_string(seed));
    // The daemon must come back with at least every acknowledged change: its file loads.
    if (round > 0) {
      ASSERT_TRUE(daemon.start()) << daemon.log();
    }
    for (const Target& target : targets) {
      if (target.lastAcked == 0) continue;
      const uint64_t n = storedN(daemon, target.uuid);
      EXPECT_GE(n, target.lastAcked);
      EXPECT_LE(n, target.lastSent);
    }
    std::string unexpected;
    std::thread client([&] {
      RawClient connection(daemon.socketPath());
      while (connection.connected()) {
        const uint64_t n = ++next;
        Target& target = targets[n % targets.size()];
        Dictionary extension{{"n", Value(n)}, {"round", Value(round)}};
        target.lastSent = n;
        if (!connection.sendMessage(
                request("annotate",
                        {{"annotations", Value(Dictionary{{"extension", Value(extension)}})},
                         {"uuids", Value(Array{Value(target.uuid)})}}),
                n)) {
          return;
        }
        auto reply = connection.readFrame(std::chrono::seconds(5));
        if (!reply) return;
        if (reply->id != n || replyErrorCode(reply->body) != 0) {
          unexpected = reply->body.description();
          return;
        }
        target.lastAcked = n;
        ++acknowledged;
      }
    });
    std::this_thread::sleep_for(
        std::chrono::milliseconds(std::uniform_int_distribution<int>(0, 30)(random)));
    daemon.kill9();
    client.join();
    ASSERT_EQ(unexpected, "") << "unexpected reply";
  }
  std::cout << acknowledged << " acknowledged changes over 100 kills\n";
  EXPECT_GT(acknowledged, 0u) << "no change was ever acknowledged: the test proved nothing";
  EXPECT_EQ(daemon.log().find("unable to load annotation database"), std::string::npos);
  for (const auto& entry : fs::directory_iterator(daemon.root().path() / "state")) {
    EXPECT_EQ(entry.path().filename().string().find(".bad-"), std::string::npos) << entry.path();
  }
}

}  // namespace
}  // namespace ek::test
