// What a hostile client of the same user can put on disk or in a request: bundles whose files
// are huge or lead out of the bundle, a registered bundle swapped for a link, lists too long
// and a long "add" meant to hold everyone else up. One daemon serves the whole group.
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include <memory>

#include "platform/dmap/Dmap.h"
#include "platform/value/Uuid.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;

Dictionary plugInInfo(const std::string& identifier, std::string padding = {}) {
  Dictionary info{
      {"QvBundleIdentifier", Value(identifier)},
      {"ZuExtension", Value(Dictionary{{"ZuExtensionPointIdentifier", Value("com.example.hostile")},
                                       {"ZuExtensionAttributes", Value(Dictionary{})}})}};
  if (!padding.empty()) info.emplace("Padding", Value(std::move(padding)));
  return info;
}

void writeInfo(const fs::path& path, const Dictionary& info) {
  fs::create_directories(path.parent_path());
  ASSERT_TRUE(dmap::writeFileAtomically(path.string(), Value(info)).ok()) << path;
}

class HostileBundle : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    daemon_ = new EkdProcess();
    root_ = fs::canonical(daemon_->root().path());
    writeInfo(host() / "Info.dmap", {{"QvBundleIdentifier", Value("com.example.host")}});
    ASSERT_TRUE(daemon_->start()) << daemon_->log();
  }
  static void TearDownTestSuite() {
    if (daemon_->running()) {
      EXPECT_EQ(daemon_->terminate(), 0) << daemon_->log();
    }
    delete daemon_;
    daemon_ = nullptr;
  }

  static fs::path host() { return root_ / "Apps" / "Host.app"; }
  static fs::path plugIn(const std::string& name) { return host() / "PlugIns" / (name + ".appex"); }
  // A plug-in bundle inside Host.app with a valid Info.dmap.
  static fs::path makePlugIn(const std::string& name) {
    const fs::path bundle = plugIn(name);
    writeInfo(bundle / "Info.dmap", plugInInfo("com.example." + name));
    return bundle;
  }

  static Value ask(const Value& message) {
    auto reply = daemon_->ask(message);
    EXPECT_TRUE(reply.has_value()) << "no reply to " << message.description().substr(0, 200) << "\n"
                                   << daemon_->log();
    return reply ? *reply : Value(Dictionary{{"errorcode", Value(uint64_t{999})}});
  }
  static Value add(Array paths) {
    return ask(request("add", {{"paths", Value(std::move(paths))}}));
  }
  static Value find(const fs::path& bundle) {
    return ask(request("find", {{"paths", Value("file://" + bundle.string())}}));
  }
  static std::optional<Uuid> uuidOf(const fs::path& bundle) {
    Value reply = find(bundle);
    const Value* form = reply.get("matches");
    if (!form || !form->getString("uuid")) return std::nullopt;
    return Uuid::parse(*form->getString("uuid"));
  }

  static EkdProcess* daemon_;
  static fs::path root_;
};

EkdProcess* HostileBundle::daemon_ = nullptr;
fs::path HostileBundle::root_;

// Each bundle is registered alone; the hostile ones are refused with the reason logged, and
// the good one registered after them is found.
TEST_F(HostileBundle, BundleFilesAreReadBeneathTheBundleAndBounded) {
  const fs::path secret = root_ / "secret.dmap";
  writeInfo(secret, plugInInfo("com.example.secret"));
  ASSERT_EQ(::chmod(secret.c_str(), 0600), 0);

  struct Row {
    std::string name;
    std::function<void(const fs::path& bundle)> make;
    std::string reason;  // in the log; empty: registered
  };
  const std::vector<Row> rows{
      {"Huge",
       [](const fs::path& bundle) {
         writeInfo(bundle / "Info.dmap",
                   plugInInfo("com.example.huge", std::string(1024 * 1024, 'x')));
       },
       "exceeds the limit of 1048576"},
      {"Linked",
       [&](const fs::path& bundle) {
         fs::create_directories(bundle);
         fs::create_symlink(secret, bundle / "Info.dmap");
       },
       "leads out of " + plugIn("Linked").string()},
      {"Fifo",
       [](const fs::path& bundle) {
         fs::create_directories(bundle);
         ASSERT_EQ(::mkfifo((bundle / "Info.dmap").c_str(), 0600), 0);
       },
       "Info.dmap: not a regular file"},
      {"Good", [](const fs::path& bundle) { writeInfo(bundle / "Info.dmap", plugInInfo("g")); },
       ""},
  };
  for (const Row& row : rows) {
    const fs::path bundle = plugIn(row.name);
    row.make(bundle);
    Value reply = add({Value(bundle.string())});
    if (row.reason.empty()) {
      EXPECT_EQ(replyErrorCode(reply), 0) << row.name << ": " << reply.description();
      EXPECT_EQ(replyErrorCode(find(bundle)), 0) << row.name;
      continue;
    }
    EXPECT_EQ(replyErrorCode(reply), 2) << row.name << ": " << reply.description();
    EXPECT_EQ(replyError(reply), "unable to register plug-in at " + bundle.string());
    EXPECT_TRUE(daemon_->logShows(row.reason)) << row.name << "\n" << daemon_->log();
    EXPECT_EQ(replyErrorCode(find(bundle)), 15) << row.name;
  }
  EXPECT_EQ(daemon_->log().find("com.example.secret"), std::string::npos);
}

TEST_F(HostileBundle, SwappedBundleDirectoryGetsNoToken) {
  const fs::path bundle = makePlugIn("Swapped");
  ASSERT_EQ(replyErrorCode(add({Value(bundle.string())})), 0);
  const std::optional<Uuid> uuid = uuidOf(bundle);
  ASSERT_TRUE(uuid);
  auto extensions = [&] {
    Value reply = find(bundle);
    const Value* form = reply.get("matches");
    const Value* tokens = form ? form->get("extensions") : nullptr;
    return tokens && tokens->dictionary() ? tokens->dictionary()->size() : 0;
  };
  auto access = [&] { return ask(request("access", {{"uuids", Value(Array{Value(*uuid)})}})); };
  ASSERT_EQ(extensions(), 1u);
  ASSERT_EQ(replyErrorCode(access()), 0);

  // Another directory, shaped like the bundle, now stands at its path.
  const fs::path elsewhere = root_ / "Elsewhere";
  fs::rename(bundle, elsewhere);
  fs::create_symlink(elsewhere, bundle);
  EXPECT_EQ(extensions(), 0u);
  Value refused = access();
  EXPECT_EQ(replyErrorCode(refused), 4) << refused.description();
  EXPECT_EQ(replyError(refused),
            "cannot create file extension to " + bundle.string() + ": " + std::to_string(ESTALE));
  EXPECT_EQ(refused.get("extensions"), nullptr);
}

TEST_F(HostileBundle, ListsOverTenThousandEntriesAreRefused) {
  const fs::path bundle = makePlugIn("Listed");
  const Value path(bundle.string());
  struct Row {
    const char* request;
    const char* key;
    size_t count;
    Value element;
    int64_t code;
    std::string error;
  };
  const Row rows[] = {
      {"add", "paths", 100000, path, 4,
       "invalid request format (paths: 100000 entries, at most 10000)"},
      {"add", "paths", 10001, path, 4,
       "invalid request format (paths: 10001 entries, at most 10000)"},
      {"remove", "paths", 10001, path, 4,
       "invalid request format (paths: 10001 entries, at most 10000)"},
      {"access", "uuids", 10001, Value(Uuid::random()), 4,
       "invalid request format (uuids: 10001 entries, at most 10000)"},
      {"ready", "uuids", 10001, Value(Uuid::random()), 4,
       "invalid request format (uuids: 10001 entries, at most 10000)"},
      // At the limit, copies of one path cost one registration.
      {"add", "paths", 10000, path, 0, ""},
  };
  for (const Row& row : rows) {
    Value reply = ask(request(row.request, {{row.key, Value(Array(row.count, row.element))}}));
    EXPECT_EQ(replyErrorCode(reply), row.code) << row.request << " " << row.count;
    EXPECT_EQ(replyError(reply), row.error) << row.request << " " << row.count;
  }
  EXPECT_EQ(replyErrorCode(find(bundle)), 0);
}

// Bundles each within the file limit, but together more than a frame can carry: the match
// that would send them all is answered with an error, and the daemon goes on serving.
TEST_F(HostileBundle, ReplyLargerThanAFrameIsAnError) {
  Array paths;
  for (int i = 0; i < 34; ++i) {
    const fs::path bundle = plugIn("Large" + std::to_string(i));
    Dictionary info = plugInInfo("com.example.large" + std::to_string(i));
    // Under ZuExtension, so each form carries it twice ("info" and "bundleInfo").
    Dictionary extension = *info["ZuExtension"].dictionary();
    extension["ZuExtensionPointIdentifier"] = Value("com.example.large");
    extension["Padding"] = Value(std::string(1000 * 1000, 'x'));
    info["ZuExtension"] = Value(std::move(extension));
    writeInfo(bundle / "Info.dmap", info);
    paths.emplace_back(bundle.string());
  }
  ASSERT_EQ(replyErrorCode(add(std::move(paths))), 0);
  auto match = [](const char* point) {
    return ask(request(
        "match", {{"rules", Value(Dictionary{{"ZuExtensionPointIdentifier", Value(point)}})}}));
  };
  Value refused = match("com.example.large");
  EXPECT_EQ(replyErrorCode(refused), 4) << refused.description().substr(0, 200);
  EXPECT_NE(replyError(refused).find("exceeds the frame limit of 67108864 bytes"),
            std::string::npos)
      << replyError(refused);
  EXPECT_EQ(replyErrorCode(match("com.example.hostile")), 0);
}

// A long "add" goes on in slices: a "find" sent by another client once the add is under way is
// answered while the add is still at work.
TEST_F(HostileBundle, LongAddDoesNotHoldOtherClients) {
  // The host application is registered first, with this one plug-in: registering it later would
  // register every plug-in in its folder at once, in the add's first step.
  ASSERT_EQ(replyErrorCode(add({Value(makePlugIn("Known").string())})), 0);
  Array paths;
  for (int i = 0; i < 1000; ++i)
    paths.emplace_back(makePlugIn("Many" + std::to_string(i)).string());

  RawClient adder(daemon_->socketPath());
  RawClient finder(daemon_->socketPath());
  ASSERT_TRUE(adder.connected() && finder.connected());
  ASSERT_TRUE(adder.sendMessage(request("add", {{"paths", Value(std::move(paths))}}), 1));
  // Asked until the add's first slice has registered the first plug-in: the add is under way
  // from then on, and the rest of its thousand bundles takes more than one slice.
  const Value first("file://" + plugIn("Many0").string());
  for (uint32_t id = 2;; ++id) {
    ASSERT_TRUE(finder.sendMessage(request("find", {{"paths", first}}), id));
    auto found = finder.readFrame(std::chrono::seconds(30));
    ASSERT_TRUE(found) << daemon_->log();
    if (replyErrorCode(found->body) == 0) break;
    ASSERT_LT(id, 1000000u) << "the first plug-in was never registered";
  }
  pollfd pending{adder.fd(), POLLIN, 0};
  EXPECT_EQ(::poll(&pending, 1, 0), 0) << "the add was answered first";
  auto added = adder.readFrame(std::chrono::seconds(120));
  ASSERT_TRUE(added) << daemon_->log();
  EXPECT_EQ(replyErrorCode(added->body), 0) << added->body.description();
  EXPECT_EQ(replyErrorCode(find(plugIn("Many999"))), 0);
}

}  // namespace
}  // namespace ek::test
