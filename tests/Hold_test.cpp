// Holds, readiness and access on a running daemon: "lock", "ready" and "access".

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <thread>

#include <fmt/format.h>

#include "platform/dmap/Dmap.h"
#include "platform/stard/ServiceManager.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;

constexpr const char* kNotesShare = "com.corvane.example.notes.share";
constexpr const char* kChange = "com.corvane.ekora.annotation-change";

class HoldRequests : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = fs::canonical(daemon_.root().path());
    apps_ = root_ / "Applications";
    fs::create_directories(apps_);
    for (const char* app : {"Viewer.app", "Notes.app"}) {
      fs::copy(fs::path(EXAMPLES_DIR) / "Applications" / app, apps_ / app,
               fs::copy_options::recursive);
    }
    ASSERT_TRUE(daemon_.start()) << daemon_.log();
    Value added =
        ask(request("add", {{"paths", Value(Array{Value(app("Viewer")), Value(app("Notes"))})}}));
    ASSERT_EQ(replyErrorCode(added), 0) << added.description();
    manager_ =
        std::make_unique<stard::FileServiceManager>(daemon_.environment().at("EKORA_RUNTIME_DIR"));
  }
  void TearDown() override {
    for (pid_t pid : children_) {
      ::kill(pid, SIGKILL);
      waitpid(pid, nullptr, 0);
    }
  }

  Value ask(const Value& message) {
    auto reply = daemon_.ask(message);
    EXPECT_TRUE(reply.has_value()) << "no reply to " << message.description() << "\n"
                                   << daemon_.log();
    return reply ? *reply : Value(Dictionary{{"errorcode", Value(uint64_t{999})}});
  }
  std::string app(const std::string& name) const { return (apps_ / (name + ".app")).string(); }
  std::string notesShare() const { return app("Notes") + "/PlugIns/Share.appex"; }

  Uuid uuidOf(const std::string& path) {
    Value reply = ask(request("find", {{"paths", Value("file://" + path)}}));
    const Value* form = reply.get("matches");
    EXPECT_TRUE(form && form->getString("uuid")) << reply.description();
    return form && form->getString("uuid") ? *Uuid::parse(*form->getString("uuid")) : Uuid();
  }
  // Identifiers that "match" of the share extension point answers.
  std::vector<std::string> shareMatches() {
    Value reply =
        ask(request("match", {{"rules", Value(Dictionary{{"ZuExtensionPointIdentifier",
                                                          Value("com.corvane.share")}})}}));
    std::vector<std::string> identifiers;
    if (const Array* matches = reply.getArray("matches")) {
      for (const Value& form : *matches) identifiers.push_back(*form.getString("identifier"));
    }
    std::sort(identifiers.begin(), identifiers.end());
    return identifiers;
  }
  // Holds last as long as the connection that placed them, so locks go on one that stays.
  Value lock(Array paths, uint64_t flags = 0) {
    return askHolder(
        request("lock", {{"paths", Value(std::move(paths))}, {"flags", Value(flags)}}));
  }
  Value askHolder(const Value& message) {
    if (!holder_) holder_ = std::make_unique<RawClient>(daemon_.socketPath());
    EXPECT_TRUE(holder_->sendMessage(message, ++holderId_));
    auto reply = holder_->readFrame(std::chrono::seconds(60));
    EXPECT_TRUE(reply.has_value()) << daemon_.log();
    return reply ? reply->body : Value(Dictionary{{"errorcode", Value(uint64_t{999})}});
  }
  pid_t launchInstance(const std::string& identifier) {
    EXPECT_EQ(manager_->addExternalService(getpid(), "/host", identifier, "/bin/sleep", {}), 0);
    auto pid = manager_->launch(getpid(), identifier, {"120"});
    EXPECT_TRUE(pid.ok());
    if (!pid.ok()) return -1;
    children_.push_back(*pid);
    return *pid;
  }

  EkdProcess daemon_;
  fs::path root_;
  fs::path apps_;
  std::unique_ptr<stard::FileServiceManager> manager_;
  std::vector<pid_t> children_;
  std::unique_ptr<RawClient> holder_;
  uint64_t holderId_ = 0;
};

TEST_F(HoldRequests, HoldHidesAnApplicationsPlugInsUntilReleased) {
  ASSERT_EQ(shareMatches().size(), 2u);
  uint64_t posts = daemon_.notificationGeneration(kChange);
  Value held = lock({Value(app("Notes"))});
  ASSERT_EQ(replyErrorCode(held), 0) << held.description();
  const Value* token = held.get("uuids");
  ASSERT_TRUE(token && token->uuid()) << held.description();
  EXPECT_EQ(daemon_.notificationGeneration(kChange), posts + 1);
  EXPECT_EQ(shareMatches(), (std::vector<std::string>{"com.corvane.example.viewer.share"}));

  // Readiness is refused while held; access is not.
  Uuid share = uuidOf(notesShare());
  Value ready = ask(request("ready", {{"uuids", Value(Array{Value(share)})}}));
  EXPECT_EQ(replyErrorCode(ready), 11);
  EXPECT_EQ(replyError(ready),
            std::string("access to plugin ") + kNotesShare + " denied: the plug-in is on hold");
  Value access = ask(request("access", {{"uuids", Value(Array{Value(share)})}}));
  EXPECT_EQ(replyErrorCode(access), 0) << access.description();

  Value released = askHolder(request("lock", {{"uuids", Value(Array{*token})}}));
  EXPECT_EQ(replyErrorCode(released), 0);
  EXPECT_EQ(daemon_.notificationGeneration(kChange), posts + 2);
  EXPECT_EQ(shareMatches().size(), 2u);
  // Releasing again changes nothing and posts nothing.
  EXPECT_EQ(replyErrorCode(ask(request("lock", {{"uuids", Value(Array{*token})}}))), 0);
  EXPECT_EQ(daemon_.notificationGeneration(kChange), posts + 2);
}

TEST_F(HoldRequests, PlacementErrors) {
  Value relative = lock({Value("Applications/Notes.app")});
  EXPECT_EQ(replyErrorCode(relative), 9);
  Value missing = lock({Value(app("Missing"))});
  EXPECT_EQ(replyErrorCode(missing), 9);
  EXPECT_EQ(replyError(missing), "invalid path: " + app("Missing"));
  Value notPlugIn = lock({Value(app("Notes"))}, 1);
  EXPECT_EQ(replyErrorCode(notPlugIn), 9);
  EXPECT_EQ(replyError(notPlugIn), "no plug-in at path:" + app("Notes"));
  EXPECT_EQ(replyErrorCode(askHolder(request("lock"))), 4);
  EXPECT_EQ(shareMatches().size(), 2u);  // no hold was left behind
}

TEST_F(HoldRequests, ClientDeathReleasesItsHold) {
  uint64_t posts = daemon_.notificationGeneration(kChange);
  {
    RawClient client(daemon_.socketPath());
    ASSERT_TRUE(client.sendMessage(request("lock", {{"paths", Value(Array{Value(notesShare())})},
                                                    {"flags", Value(uint64_t{1})}}),
                                   1));
    auto reply = client.readFrame();
    ASSERT_TRUE(reply.has_value());
    ASSERT_EQ(replyErrorCode(reply->body), 0) << reply->body.description();
    EXPECT_EQ(shareMatches().size(), 1u);
  }
  for (int i = 0; i < 500 && shareMatches().size() != 2u; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  EXPECT_EQ(shareMatches().size(), 2u);
  EXPECT_EQ(daemon_.notificationGeneration(kChange), posts + 2);
}

TEST_F(HoldRequests, BusyPlugInRefusesTheHoldWithItsConflicts) {
  launchInstance(kNotesShare);
  Value refused = lock({Value(app("Notes"))}, 2);
  EXPECT_EQ(replyErrorCode(refused), 14);
  EXPECT_EQ(replyError(refused), "plug-ins are busy");
  const Array* conflicts = refused.getArray("conflicts");
  ASSERT_TRUE(conflicts) << refused.description();
  ASSERT_EQ(conflicts->size(), 1u);
  EXPECT_NE((*conflicts)[0].description().find(kNotesShare), std::string::npos);
  EXPECT_EQ(shareMatches().size(), 2u);
}

TEST_F(HoldRequests, ForcedHoldAnswersOnlyAfterTheInstanceIsGone) {
  pid_t instance = launchInstance(kNotesShare);
  ASSERT_GT(instance, 0);
  // Refusing busy plug-ins wins over ending them.
  Value held = lock({Value(app("Notes"))}, 2 | 4);
  EXPECT_EQ(replyErrorCode(held), 14);
  Value forced = lock({Value(app("Notes"))}, 4);
  ASSERT_EQ(replyErrorCode(forced), 0) << forced.description();
  // The instance has been signalled before the reply: it ends without any further help.
  int status = 0;
  ASSERT_EQ(waitpid(instance, &status, 0), instance);
  EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGTERM);
  std::erase(children_, instance);
  EXPECT_EQ(shareMatches(), (std::vector<std::string>{"com.corvane.example.viewer.share"}));
}

TEST_F(HoldRequests, ReadyDeclaresThePlugInForTheHost) {
  Uuid share = uuidOf(notesShare());
  Value ready = ask(request("ready", {{"uuids", Value(Array{Value(share), Value(share)})}}));
  ASSERT_EQ(replyErrorCode(ready), 0) << ready.description();
  // Declarations of this (test) host live under its pid; the daemon asked from our process.
  fs::path services = fs::path(daemon_.environment().at("EKORA_RUNTIME_DIR")) / "services";
  bool found = false;
  for (const auto& host : fs::directory_iterator(services)) {
    fs::path declaration = host.path() / (std::string(kNotesShare) + ".dmap");
    if (!fs::exists(declaration)) continue;
    found = true;
    auto file = dmap::readFile(declaration.string());
    ASSERT_TRUE(file.ok());
    EXPECT_TRUE(file->getDictionary("overlay")) << file->description();
  }
  EXPECT_TRUE(found) << daemon_.log();

  Value environment = ask(request(
      "ready", {{"uuids", Value(Array{Value(share)})}, {"environment", Value(Dictionary{})}}));
  EXPECT_EQ(replyErrorCode(environment), 11);
  EXPECT_EQ(replyError(environment),
            "Transmission of environment variables requires the "
            "com.corvane.developer.ekora.provide-environment host entitlement");
}

// A bundle that declares no executable is launched as the bundle itself.
TEST_F(HoldRequests, ReadyOfAPlugInWithoutExecutableDeclaresIt) {
  fs::path info = fs::path(notesShare()) / "Info.dmap";
  auto dictionary = dmap::readFile(info.string());
  ASSERT_TRUE(dictionary.ok());
  dictionary->dictionary()->erase("QvBundleExecutable");
  auto text = dmap::write(*dictionary);
  ASSERT_TRUE(text.ok());
  std::ofstream(info) << *text;
  ASSERT_EQ(replyErrorCode(ask(request("add", {{"paths", Value(Array{Value(app("Notes"))})}}))), 0);
  Value found = ask(request("find", {{"paths", Value("file://" + notesShare())}}));
  const Value* form = found.get("matches");
  ASSERT_TRUE(form && form->getDictionary("bundleInfo")) << found.description();
  ASSERT_FALSE(form->getDictionary("bundleInfo")->contains("QvBundleExecutable"));
  Value ready = ask(request("ready", {{"uuids", Value(Array{Value(uuidOf(notesShare()))})}}));
  EXPECT_EQ(replyErrorCode(ready), 0) << ready.description();
}

TEST_F(HoldRequests, DeclarationsOfAnExitedHostArePrunedAndALiveHostsStay) {
  Uuid share = uuidOf(notesShare());
  Value ours = ask(request("ready", {{"uuids", Value(Array{Value(share)})}}));
  ASSERT_EQ(replyErrorCode(ours), 0) << ours.description();
  // ekctl is a host that exits as soon as it has its answer.
  auto ready = daemon_.ekctl({"ready", share.string()});
  ASSERT_EQ(ready.status, 0) << ready.err;

  fs::path services = fs::path(daemon_.environment().at("EKORA_RUNTIME_DIR")) / "services";
  const std::string declaration = std::string(kNotesShare) + ".dmap";
  auto otherHostsDeclaring = [&] {
    std::vector<std::string> hosts;
    for (const auto& host : fs::directory_iterator(services)) {
      if (host.path().filename() == std::to_string(getpid())) continue;
      if (fs::exists(host.path() / declaration)) hosts.push_back(host.path().filename());
    }
    return hosts;
  };
  for (int i = 0; i < 1000 && !otherHostsDeclaring().empty(); ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  EXPECT_EQ(otherHostsDeclaring(), std::vector<std::string>{}) << daemon_.log();
  EXPECT_TRUE(daemon_.logShows("exited: pruning its service declarations")) << daemon_.log();
  EXPECT_TRUE(fs::exists(services / std::to_string(getpid()) / declaration));
}

TEST_F(HoldRequests, TerminationReleasesHoldsAndTellsWatchers) {
  Value held = lock({Value(app("Notes"))});
  ASSERT_EQ(replyErrorCode(held), 0) << held.description();
  const Value* token = held.get("uuids");
  ASSERT_TRUE(token && token->uuid()) << held.description();
  uint64_t posts = daemon_.notificationGeneration(kChange);
  EXPECT_EQ(daemon_.terminate(), 0);
  EXPECT_EQ(daemon_.notificationGeneration(kChange), posts + 1);
  EXPECT_NE(daemon_.log().find("releasing plug-in hold " + token->uuid()->string() +
                               " because server is stopping"),
            std::string::npos)
      << daemon_.log();
}

TEST_F(HoldRequests, AccessAnswersOneTokenPerUuidInOrder) {
  Uuid share = uuidOf(notesShare());
  Uuid thumbs = uuidOf(app("Viewer") + "/PlugIns/Thumbs.appex");
  Value reply = ask(request("access", {{"uuids", Value(Array{Value(thumbs), Value(share)})}}));
  ASSERT_EQ(replyErrorCode(reply), 0) << reply.description();
  const Array* tokens = reply.getArray("extensions");
  ASSERT_TRUE(tokens);
  ASSERT_EQ(tokens->size(), 2u);
  auto hexOf = [](const std::string& text) {
    std::string hex;
    for (unsigned char c : text) hex += fmt::format("{:02x}", c);
    return hex;
  };
  EXPECT_NE((*tokens)[0].string()->find(hexOf(app("Viewer") + "/PlugIns/Thumbs.appex")),
            std::string::npos);
  EXPECT_NE((*tokens)[1].string()->find(hexOf(notesShare())), std::string::npos);
  Value unknown = ask(request("access", {{"uuids", Value(Array{Value(Uuid::random())})}}));
  EXPECT_EQ(replyErrorCode(unknown), 4);
}

}  // namespace
}  // namespace ek::test
