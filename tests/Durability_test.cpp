// An acknowledged annotation is durable: killing the daemon at any moment never loses a change
// it has replied to, and never leaves an annotation file it cannot load.
#include <gtest/gtest.h>

#include <cstdlib>
#include <iostream>
#include <random>
#include <thread>

#include "platform/dmap/Dmap.h"
#include "platform/value/Uuid.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;

constexpr int kRounds = 100;
constexpr int kMaxDelayMs = 30;

struct Target {
  const char* identifier;
  const char* bundle;  // relative to the application
  Uuid uuid;
  uint64_t lastSent = 0;   // 0: nothing sent yet
  uint64_t lastAcked = 0;  // 0: nothing acknowledged yet
};

std::optional<Uuid> uuidOf(const EkdProcess& daemon, const std::string& path) {
  auto reply = daemon.ask(request("find", {{"paths", Value("file://" + path)}}));
  const Value* form = reply ? reply->get("matches") : nullptr;
  if (!form || !form->getString("uuid")) return std::nullopt;
  return Uuid::parse(*form->getString("uuid"));
}

// The "n" of an annotation's extension; 0 when there is none.
uint64_t storedN(const Value* annotation) {
  const Value* extension = annotation ? annotation->get("extension") : nullptr;
  const uint64_t* n = extension ? extension->getUnsigned("n") : nullptr;
  return n ? *n : 0;
}

uint64_t seedForThisRun() {
  if (const char* fixed = std::getenv("EKORA_DURABILITY_SEED"))
    return std::strtoull(fixed, nullptr, 10);
  return std::random_device{}();
}

TEST(Durability, AcknowledgedAnnotationsSurviveSigkill) {
  uint64_t seed = seedForThisRun();
  std::cout << "seed " << seed << " (set EKORA_DURABILITY_SEED to repeat the kill delays)\n";
  RecordProperty("seed", std::to_string(seed));
  std::mt19937_64 random(seed);

  TempDir dbRoot;
  fs::path file = fs::canonical(dbRoot.path()) / "Ekora-Annotations";
  EkdProcess daemon({"-d", file.string()});
  daemon.setEnvironment("EKORA_LOG", "default");
  fs::path root = fs::canonical(daemon.root().path());
  fs::copy(fs::path(EXAMPLES_DIR) / "Applications/Viewer.app", root / "Viewer.app",
           fs::copy_options::recursive);
  std::string app = (root / "Viewer.app").string();

  ASSERT_TRUE(daemon.start()) << daemon.log();
  auto added = daemon.ask(request("add", {{"paths", Value(Array{Value(app)})}}));
  ASSERT_TRUE(added && replyErrorCode(*added) == 0) << daemon.log();
  std::vector<Target> targets{{"com.corvane.example.viewer.thumbs", "/PlugIns/Thumbs.appex", {}},
                              {"com.corvane.example.viewer.share", "/PlugIns/Share.appex", {}}};
  for (Target& target : targets) {
    auto uuid = uuidOf(daemon, app + target.bundle);
    ASSERT_TRUE(uuid) << target.identifier << "\n" << daemon.log();
    target.uuid = *uuid;
  }

  uint64_t next = 0;
  uint64_t acknowledged = 0;
  for (int round = 0; round < kRounds; ++round) {
    SCOPED_TRACE("round " + std::to_string(round) + ", seed " + std::to_string(seed));
    if (round > 0) {
      ASSERT_TRUE(daemon.start()) << daemon.log();
    }

    // The daemon must come back with at least every acknowledged change.
    for (const Target& target : targets) {
      if (target.lastAcked == 0) continue;
      auto reply = daemon.ask(request("find", {{"uuids", Value(target.uuid)}}));
      ASSERT_TRUE(reply) << daemon.log();
      const Value* form = reply->get("matches");
      uint64_t n = storedN(form ? form->get("annotations") : nullptr);
      EXPECT_GE(n, target.lastAcked) << target.identifier;
      EXPECT_LE(n, target.lastSent) << target.identifier;
    }

    std::string unexpected;
    std::thread client([&] {
      RawClient connection(daemon.socketPath());
      if (!connection.connected()) return;
      while (true) {
        uint64_t n = ++next;
        Target& target = targets[n % targets.size()];
        Dictionary extension{{"n", Value(n)}, {"round", Value(round)}};
        Value message = request(
            "annotate", {{"annotations", Value(Dictionary{{"extension", Value(extension)}})},
                         {"uuids", Value(Array{Value(target.uuid)})}});
        target.lastSent = n;
        if (!connection.sendMessage(message, n)) return;
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
    int delay = std::uniform_int_distribution<int>(0, kMaxDelayMs)(random);
    std::this_thread::sleep_for(std::chrono::milliseconds(delay));
    daemon.kill9();
    client.join();
    ASSERT_EQ(unexpected, "") << "unexpected reply";

    bool anyAcked = false;
    for (const Target& target : targets) anyAcked |= target.lastAcked != 0;
    if (!anyAcked && !fs::exists(file)) continue;
    auto parsed = dmap::readFile(file.string());
    ASSERT_TRUE(parsed) << parsed.error().message;
    const uint64_t* version = parsed.value().getUnsigned("version");
    ASSERT_TRUE(version && *version == 16) << parsed.value().description();
    const Value* data = parsed.value().get("data");
    ASSERT_TRUE(data && data->dictionary()) << parsed.value().description();
    for (const Target& target : targets) {
      if (target.lastAcked == 0) continue;
      uint64_t n = storedN(data->get(target.identifier));
      EXPECT_GE(n, target.lastAcked) << target.identifier << " in round " << round;
      EXPECT_LE(n, target.lastSent) << target.identifier << " in round " << round;
    }
  }

  std::cout << acknowledged << " acknowledged changes over " << kRounds << " kills\n";
  EXPECT_GT(acknowledged, 0u) << "no change was ever acknowledged: the test proved nothing";
  std::string log = daemon.log();
  EXPECT_EQ(log.find("unable to load annotation database"), std::string::npos) << log;
  for (const auto& entry : fs::directory_iterator(file.parent_path())) {
    EXPECT_EQ(entry.path().filename().string().find(".bad-"), std::string::npos) << entry.path();
  }
}

}  // namespace
}  // namespace ek::test
