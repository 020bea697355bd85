// One path through a real ekd per request type, asked by hand and through ekctl; the shapes of
// each request are tabled on the handlers (ekd/Handlers_test.cpp).
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>

#include "platform/dmap/Dmap.h"
#include "platform/stard/ServiceManager.h"
#include "platform/value/Uuid.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;

constexpr const char* kManager = "com.corvane.private.ekora.manager";
constexpr const char* kChange = "com.corvane.ekora.annotation-change";
constexpr const char* kNotesShare = "com.corvane.example.notes.share";
constexpr const char* kViewerShare = "com.corvane.example.viewer.share";

// A daemon with the example system volume, Viewer.app and Notes.app.
class Requests : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    daemon_ = new EkdProcess();
    apps_ = fs::canonical(daemon_->root().path()) / "Applications";
    fs::copy(fs::path(EXAMPLES_DIR) / "System", daemon_->root().path() / "System",
             fs::copy_options::recursive);
    fs::copy(fs::path(EXAMPLES_DIR) / "Applications", apps_, fs::copy_options::recursive);
    ASSERT_TRUE(daemon_->start()) << daemon_->log();
    auto added = daemon_->ekctl({"add", app("Viewer"), app("Notes")});
    ASSERT_EQ(added.status, 0) << added.err;
  }
  static void TearDownTestSuite() {
    EXPECT_EQ(daemon_->terminate(), 0) << daemon_->log();
    delete daemon_;
  }

  static std::string app(const std::string& name) { return (apps_ / (name + ".app")).string(); }
  static std::string notesShare() { return app("Notes") + "/PlugIns/Share.appex"; }
  static Value ask(const Value& message) {
    auto reply = daemon_->ask(message);
    EXPECT_TRUE(reply) << message.description() << "\n" << daemon_->log();
    return reply ? *reply : Value(Dictionary{{"errorcode", Value(uint64_t{999})}});
  }
  // The form "find" answers for a bundle path, or nothing.
  static Value find(const std::string& path) {
    Value reply = ask(request("find", {{"paths", Value("file://" + path)}}));
    const Value* form = reply.get("matches");
    return form ? *form : Value();
  }
  static Uuid uuidOf(const std::string& path) {
    const Value form = find(path);
    const std::string* uuid = form.getString("uuid");
    return uuid ? *Uuid::parse(*uuid) : Uuid();
  }
  // The identifiers "match" answers for the share extension point.
  static std::vector<std::string> shareMatches() {
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

  static EkdProcess* daemon_;
  static fs::path apps_;
};

EkdProcess* Requests::daemon_ = nullptr;
fs::path Requests::apps_;

TEST_F(Requests, FindAnswersTheFormByPathAndByUuid) {
  Value form = find(notesShare());
  ASSERT_TRUE(form.getString("uuid")) << form.description();
  EXPECT_EQ(*form.getString("identifier"), kNotesShare);
  EXPECT_EQ(*form.get("annotations"), Value(Dictionary{}));
  Value byUuid = ask(request("find", {{"uuids", Value(uuidOf(notesShare()))}}));
  ASSERT_TRUE(byUuid.get("matches")) << byUuid.description();
  EXPECT_EQ(*byUuid.get("matches")->getString("path"), notesShare());
  auto info = daemon_->ekctl({"info", kNotesShare, "-o", "json"});
  EXPECT_EQ(info.status, 0) << info.err;
  EXPECT_NE(info.out.find(*form.getString("uuid")), std::string::npos) << info.out;
}

TEST_F(Requests, MatchAnswersEachPlugInOfTheRulesOnce) {
  EXPECT_EQ(shareMatches(), (std::vector<std::string>{kNotesShare, kViewerShare}));
  auto all = daemon_->ekctl({"--json", "match"});
  ASSERT_EQ(all.status, 0) << all.err;
  for (const char* identifier : {"com.corvane.spellcheck", kNotesShare, kViewerShare}) {
    EXPECT_NE(all.out.find(identifier), std::string::npos) << identifier << "\n" << all.out;
  }
}

TEST_F(Requests, AnnotationsAreStoredAndPosted) {
  const Uuid thumbs = uuidOf(app("Viewer") + "/PlugIns/Thumbs.appex");
  const uint64_t posts = daemon_->notificationGeneration(kChange);
  auto elected = daemon_->ekctl({"annotate", "--set", R"({"election":1})", thumbs.string()});
  ASSERT_EQ(elected.status, 0) << elected.err;
  EXPECT_EQ(daemon_->notificationGeneration(kChange), posts + 1);
  const Dictionary extension{{"k", Value("v")}};
  Value bulk = ask(request(
      "bulk-annotate", {{"annotations", Value(Dictionary{{thumbs.string(), Value(extension)}})}}));
  EXPECT_EQ(replyErrorCode(bulk), 0) << bulk.description();
  EXPECT_EQ(daemon_->notificationGeneration(kChange), posts + 2);
  EXPECT_EQ(*find(app("Viewer") + "/PlugIns/Thumbs.appex").get("annotations"),
            Value(Dictionary{{"election", Value(1)}, {"extension", Value(extension)}}));
}

TEST_F(Requests, HoldHidesAnApplicationsPlugInsUntilReleased) {
  // Holds last as long as the connection that placed them.
  RawClient holder(daemon_->socketPath());
  ASSERT_TRUE(
      holder.sendMessage(request("lock", {{"paths", Value(Array{Value(app("Notes"))})}}), 1));
  auto held = holder.readFrame();
  ASSERT_TRUE(held && held->body.get("uuids") && held->body.get("uuids")->uuid()) << daemon_->log();
  EXPECT_EQ(shareMatches(), std::vector<std::string>{kViewerShare});
  Value ready = ask(request("ready", {{"uuids", Value(Array{Value(uuidOf(notesShare()))})}}));
  EXPECT_EQ(replyErrorCode(ready), 11);
  EXPECT_EQ(replyError(ready),
            std::string("access to plugin ") + kNotesShare + " denied: the plug-in is on hold");

  ASSERT_TRUE(
      holder.sendMessage(request("lock", {{"uuids", Value(Array{*held->body.get("uuids")})}}), 2));
  auto released = holder.readFrame();
  ASSERT_TRUE(released);
  EXPECT_EQ(replyErrorCode(released->body), 0);
  EXPECT_EQ(shareMatches(), (std::vector<std::string>{kNotesShare, kViewerShare}));
}

TEST_F(Requests, ReadyDeclaresThePlugInAndAccessAnswersATokenPerUuid) {
  const Uuid share = uuidOf(notesShare());
  Value ready = ask(request("ready", {{"uuids", Value(Array{Value(share)})}}));
  ASSERT_EQ(replyErrorCode(ready), 0) << ready.description();
  // Declared for this process, the host that asked.
  fs::path declaration = fs::path(daemon_->environment().at("EKORA_RUNTIME_DIR")) / "services" /
                         std::to_string(getpid()) / (std::string(kNotesShare) + ".dmap");
  auto declared = dmap::readFile(declaration.string());
  ASSERT_TRUE(declared.ok()) << declaration;
  EXPECT_TRUE(declared->getDictionary("overlay")) << declared->description();

  const Uuid thumbs = uuidOf(app("Viewer") + "/PlugIns/Thumbs.appex");
  Value access = ask(request("access", {{"uuids", Value(Array{Value(thumbs), Value(share)})}}));
  ASSERT_EQ(replyErrorCode(access), 0) << access.description();
  const Array* tokens = access.getArray("extensions");
  ASSERT_TRUE(tokens && tokens->size() == 2) << access.description();
  EXPECT_NE((*tokens)[0], (*tokens)[1]);
}

TEST_F(Requests, BulkAndStatusAnswer) {
  EXPECT_EQ(daemon_->ekctl({"bulk"}).status, 0);
  Value status = ask(request("status"));
  ASSERT_TRUE(status.getUnsigned("pid")) << status.description();
  EXPECT_EQ(*status.getUnsigned("pid"), static_cast<uint64_t>(daemon_->pid()));
  // The system plug-in and the four of the applications.
  EXPECT_EQ(*status.getUnsigned("plugins"), 5u) << status.description();
}

// Last, as it uninstalls Notes.app: its plug-ins' running instances end with it.
TEST_F(Requests, RemoveNeedsTheManagerEntitlementAndEndsThePlugInsInstances) {
  stard::FileServiceManager manager(daemon_->environment().at("EKORA_RUNTIME_DIR"));
  std::vector<pid_t> instances;
  for (const char* identifier : {kNotesShare, "com.corvane.example.notes.action"}) {
    ASSERT_EQ(manager.addExternalService(getpid(), "/host", identifier, "/bin/sleep", {}), 0);
    auto pid = manager.launch(getpid(), identifier, {"120"});
    ASSERT_TRUE(pid.ok());
    instances.push_back(*pid);
  }
  auto refused = daemon_->ekctl({"remove", app("Notes")});
  EXPECT_EQ(refused.status, 1);
  EXPECT_NE(refused.err.find("error 11: caller lacks entitlement"), std::string::npos)
      << refused.err;
  std::string entitled = ekctlWithEntitlements(daemon_->root().path() / "manager", {kManager});
  auto removed = daemon_->ekctlAs(entitled, {"remove", app("Notes")});
  EXPECT_EQ(removed.status, 0) << removed.err;
  EXPECT_FALSE(find(notesShare()).getString("uuid"));
  // Each instance ends on the SIGTERM sent before the reply; the test's own timeout bounds this.
  for (pid_t pid : instances) {
    if (removed.status != 0) ::kill(pid, SIGKILL);
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGTERM) << status;
  }
}

}  // namespace
}  // namespace ek::test
