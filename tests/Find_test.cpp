// Registering, removing and looking up plug-ins on a running daemon: "add", "remove", "bulk"
// and "find", spoken by hand and through ekctl.
#include <gtest/gtest.h>
#include <unistd.h>

#include <fstream>

#include "platform/value/Uuid.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;

constexpr const char* kManager = "com.corvane.private.ekora.manager";
constexpr const char* kThumbsId = "com.corvane.example.viewer.thumbs";
constexpr const char* kViewerShareId = "com.corvane.example.viewer.share";
constexpr const char* kActionId = "com.corvane.example.notes.action";
constexpr const char* kNotesShareId = "com.corvane.example.notes.share";

std::string stringAt(const Value& dictionary, std::string_view key) {
  const std::string* text = dictionary.getString(key);
  return text ? *text : std::string("<absent>");
}

Value pathsRequest(std::string_view type, Array paths) {
  return request(type, {{"paths", Value(std::move(paths))}});
}

class FindRequests : public ::testing::Test {
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
  }
  void TearDown() override {
    if (daemon_.running()) {
      EXPECT_EQ(daemon_.terminate(), 0) << daemon_.log();
    }
  }

  Value ask(const Value& message) {
    auto reply = daemon_.ask(message);
    EXPECT_TRUE(reply.has_value()) << "no reply to " << message.description() << "\n"
                                   << daemon_.log();
    return reply ? *reply : Value(Dictionary{{"errorcode", Value(uint64_t{999})}});
  }

  std::string viewer() const { return (apps_ / "Viewer.app").string(); }
  std::string notes() const { return (apps_ / "Notes.app").string(); }
  std::string thumbs() const { return viewer() + "/PlugIns/Thumbs.appex"; }
  std::string viewerShare() const { return viewer() + "/PlugIns/Share.appex"; }
  std::string action() const { return notes() + "/PlugIns/Action.appex"; }
  std::string notesShare() const { return notes() + "/PlugIns/Share.appex"; }

  void addExamples() {
    Value reply = ask(pathsRequest("add", {Value(viewer()), Value(notes())}));
    ASSERT_EQ(replyErrorCode(reply), 0) << reply.description();
  }

  Value findByUrl(const std::string& path, uint64_t version = 3) {
    Dictionary message{{"request", Value("find")}, {"version", Value(version)}};
    message["paths"] = Value("file://" + path);
    return ask(Value(std::move(message)));
  }
  Value findByUuid(const Uuid& uuid) { return ask(request("find", {{"uuids", Value(uuid)}})); }

  // The UUID the daemon reports for the plug-in bundle at path.
  std::optional<Uuid> uuidOf(const std::string& path) {
    Value reply = findByUrl(path);
    const Value* form = reply.get("matches");
    if (!form || !form->getString("uuid")) return std::nullopt;
    return Uuid::parse(*form->getString("uuid"));
  }

  std::string managerEkctl() { return ekctlWithEntitlements(root_ / "manager", {kManager}); }

  static void expectFound(const Value& reply, const std::string& identifier,
                          const std::string& path) {
    ASSERT_EQ(replyErrorCode(reply), 0) << reply.description();
    const Value* form = reply.get("matches");
    ASSERT_TRUE(form && form->dictionary()) << reply.description();
    EXPECT_EQ(stringAt(*form, "identifier"), identifier);
    EXPECT_EQ(stringAt(*form, "path"), path);
  }
  static void expectNotFound(const Value& reply) {
    EXPECT_EQ(replyErrorCode(reply), 15) << reply.description();
    EXPECT_EQ(replyError(reply), "Cannot locate PlugIn");
    EXPECT_EQ(reply.get("matches"), nullptr);
  }

  EkdProcess daemon_;
  fs::path root_;
  fs::path apps_;
};

TEST_F(FindRequests, AddOfTwoApplicationsRegistersAllTheirPlugInsAndRepliesWithNoKeys) {
  Value reply = ask(pathsRequest("add", {Value(viewer()), Value(notes())}));
  ASSERT_NE(reply.dictionary(), nullptr);
  EXPECT_TRUE(reply.dictionary()->empty()) << reply.description();
  expectFound(findByUrl(thumbs()), kThumbsId, thumbs());
  expectFound(findByUrl(viewerShare()), kViewerShareId, viewerShare());
  expectFound(findByUrl(action()), kActionId, action());
  expectFound(findByUrl(notesShare()), kNotesShareId, notesShare());
}

TEST_F(FindRequests, AddThroughEkctlRegistersTheApplication) {
  auto result = daemon_.ekctl({"add", viewer()});
  ASSERT_EQ(result.status, 0) << result.err << daemon_.log();
  expectFound(findByUrl(thumbs()), kThumbsId, thumbs());
}

TEST_F(FindRequests, NothingIsFoundBeforeItIsAdded) {
  expectNotFound(findByUrl(thumbs()));
}

TEST_F(FindRequests, FindByUuidAnswersThePlugInsForm) {
  addExamples();
  auto uuid = uuidOf(action());
  ASSERT_TRUE(uuid);
  Value reply = findByUuid(*uuid);
  expectFound(reply, kActionId, action());
  const Value* form = reply.get("matches");
  ASSERT_NE(form, nullptr);
  EXPECT_EQ(stringAt(*form, "uuid"), uuid->string());
}

TEST_F(FindRequests, UuidsOfDifferentPlugInsDiffer) {
  addExamples();
  auto a = uuidOf(thumbs());
  auto b = uuidOf(viewerShare());
  ASSERT_TRUE(a && b);
  EXPECT_NE(*a, *b);
}

TEST_F(FindRequests, FindByUrlWithATrailingSlashNamesTheSameBundle) {
  addExamples();
  expectFound(findByUrl(thumbs() + "/"), kThumbsId, thumbs());
}

TEST_F(FindRequests, FindThroughEkctlByUuidAndByUrl) {
  addExamples();
  auto uuid = uuidOf(thumbs());
  ASSERT_TRUE(uuid);
  auto byUuid = daemon_.ekctl({"--json", "find", "--uuid", uuid->string()});
  EXPECT_EQ(byUuid.status, 0) << byUuid.err;
  EXPECT_NE(byUuid.out.find(kThumbsId), std::string::npos) << byUuid.out;
  auto byUrl = daemon_.ekctl({"--json", "find", "--url", "file://" + thumbs()});
  EXPECT_EQ(byUrl.status, 0) << byUrl.err;
  EXPECT_NE(byUrl.out.find(uuid->string()), std::string::npos) << byUrl.out;
  auto unknown = daemon_.ekctl({"find", "--uuid", Uuid::random().string()});
  EXPECT_EQ(unknown.status, 1);
  EXPECT_NE(unknown.err.find("ekctl: error 15: Cannot locate PlugIn"), std::string::npos)
      << unknown.err;
}

TEST_F(FindRequests, PathDecidesWhenBothKeysAreGiven) {
  addExamples();
  auto thumbsUuid = uuidOf(thumbs());
  ASSERT_TRUE(thumbsUuid);
  // Both known: the path wins.
  expectFound(ask(request("find", {{"uuids", Value(*thumbsUuid)},
                                   {"paths", Value("file://" + viewerShare())}})),
              kViewerShareId, viewerShare());
  // Only the UUID known: the unknown path still decides.
  expectNotFound(
      ask(request("find", {{"uuids", Value(*thumbsUuid)},
                           {"paths", Value("file://" + root_.string() + "/None.appex")}})));
  // Only the path known.
  expectFound(ask(request("find", {{"uuids", Value(Uuid::random())},
                                   {"paths", Value("file://" + action())}})),
              kActionId, action());
}

TEST_F(FindRequests, UuidsGivenAsAnArrayIsNoUuid) {
  addExamples();
  auto uuid = uuidOf(thumbs());
  ASSERT_TRUE(uuid);
  expectNotFound(ask(request("find", {{"uuids", Value(Array{Value(*uuid)})}})));
}

TEST_F(FindRequests, PathsGivenAsAnArrayIsNoPath) {
  addExamples();
  auto uuid = uuidOf(thumbs());
  ASSERT_TRUE(uuid);
  expectFound(ask(request("find", {{"uuids", Value(*uuid)},
                                   {"paths", Value(Array{Value("file://" + viewerShare())})}})),
              kThumbsId, thumbs());
}

TEST_F(FindRequests, UuidGivenAsTextIsNoUuid) {
  addExamples();
  auto uuid = uuidOf(thumbs());
  ASSERT_TRUE(uuid);
  expectNotFound(ask(request("find", {{"uuids", Value(uuid->string())}})));
}

TEST_F(FindRequests, UnknownUuidIsNotFound) {
  addExamples();
  expectNotFound(findByUuid(Uuid::random()));
}

TEST_F(FindRequests, RequestWithNeitherKeyIsNotFound) {
  addExamples();
  expectNotFound(ask(request("find")));
  EXPECT_TRUE(daemon_.logShows("plugin not found"));
}

TEST_F(FindRequests, BarePathIsNotAUrl) {
  addExamples();
  expectNotFound(ask(request("find", {{"paths", Value(thumbs())}})));
}

TEST_F(FindRequests, FormFollowsAReRegisteredBundleAndNewAnnotations) {
  // Found forms are kept encoded between requests; none may outlive what it was made from.
  addExamples();
  auto uuid = uuidOf(thumbs());
  ASSERT_TRUE(uuid);
  Value before = findByUuid(*uuid);
  ASSERT_NE(before.get("matches"), nullptr) << before.description();
  EXPECT_EQ(stringAt(*before.get("matches"), "version"), "1.0");

  fs::path info = fs::path(thumbs()) / "Info.dmap";
  std::string text;
  {
    std::ifstream in(info);
    text.assign(std::istreambuf_iterator<char>(in), {});
  }
  const std::string from = "<key>ZuExtensionVersion</key>\n\t\t\t<string>1.0</string>";
  auto at = text.find(from);
  ASSERT_NE(at, std::string::npos);
  text.replace(at, from.size(), "<key>ZuExtensionVersion</key>\n\t\t\t<string>2.5</string>");
  std::ofstream(info, std::ios::trunc) << text;
  addExamples();
  ASSERT_EQ(replyErrorCode(ask(request(
                "annotate", {{"annotations", Value(Dictionary{{"election", Value(uint64_t{1})}})},
                             {"uuids", Value(Array{Value(*uuid)})}}))),
            0);

  Value after = findByUuid(*uuid);
  const Value* form = after.get("matches");
  ASSERT_NE(form, nullptr) << after.description();
  EXPECT_EQ(stringAt(*form, "uuid"), uuid->string());
  EXPECT_EQ(stringAt(*form, "version"), "2.5") << after.description();
  const Dictionary* annotations = form->getDictionary("annotations");
  ASSERT_NE(annotations, nullptr) << after.description();
  auto election = annotations->find("election");
  ASSERT_NE(election, annotations->end()) << after.description();
  ASSERT_NE(election->second.unsignedNumber(), nullptr);
  EXPECT_EQ(*election->second.unsignedNumber(), 1u);
}

TEST_F(FindRequests, FormCarriesEmptyAnnotationsWhenNoneAreStored) {
  addExamples();
  Value reply = findByUrl(thumbs());
  const Value* form = reply.get("matches");
  ASSERT_NE(form, nullptr) << reply.description();
  const Dictionary* annotations = form->getDictionary("annotations");
  ASSERT_NE(annotations, nullptr) << reply.description();
  EXPECT_TRUE(annotations->empty());
}

TEST_F(FindRequests, VersionTwoFindSucceedsWithoutMatches) {
  addExamples();
  Value reply = findByUrl(thumbs(), 2);
  EXPECT_EQ(replyErrorCode(reply), 0) << reply.description();
  EXPECT_EQ(reply.get("error"), nullptr);
  EXPECT_EQ(reply.get("matches"), nullptr) << reply.description();
}

TEST_F(FindRequests, VersionTwoFindOfAnUnknownPlugInStillFails) {
  addExamples();
  Value reply = findByUrl(root_.string() + "/None.appex", 2);
  EXPECT_EQ(replyErrorCode(reply), 15) << reply.description();
}

TEST_F(FindRequests, SystemPlugInsAreFoundWithoutBeingAdded) {
  ASSERT_EQ(daemon_.terminate(), 0);
  fs::copy(fs::path(EXAMPLES_DIR) / "System", daemon_.root().path() / "System",
           fs::copy_options::recursive | fs::copy_options::overwrite_existing);
  ASSERT_TRUE(daemon_.start()) << daemon_.log();
  std::string bundle = (root_ / "System/Library/PlugIns/SpellCheck.bundle").string();
  Value reply = findByUrl(bundle);
  ASSERT_EQ(replyErrorCode(reply), 0) << reply.description();
  const Value* form = reply.get("matches");
  ASSERT_NE(form, nullptr);
  EXPECT_EQ(stringAt(*form, "path"), bundle);
}

TEST_F(FindRequests, AddOfANonexistentPathIsAnInvalidPlugInPath) {
  std::string missing = (apps_ / "Missing.app").string();
  Value reply = ask(pathsRequest("add", {Value(missing)}));
  EXPECT_EQ(replyErrorCode(reply), 9);
  EXPECT_EQ(replyError(reply), "invalid plugin path: " + missing);
}

TEST_F(FindRequests, AddOfARelativePathIsRefusedBeforeAnyRegistration) {
  Value reply = ask(pathsRequest("add", {Value(viewer()), Value("Applications/Notes.app")}));
  EXPECT_EQ(replyErrorCode(reply), 9);
  EXPECT_EQ(replyError(reply), "absolute path required: Applications/Notes.app");
  // The walk stops there, but the path before it was registered.
  expectFound(findByUrl(thumbs()), kThumbsId, thumbs());
  expectNotFound(findByUrl(action()));
}

TEST_F(FindRequests, AddStopsAtTheFirstBadPathAndKeepsEarlierRegistrations) {
  std::string missing = (apps_ / "Missing.app").string();
  Value reply = ask(pathsRequest("add", {Value(viewer()), Value(missing), Value(notes())}));
  EXPECT_EQ(replyErrorCode(reply), 9);
  EXPECT_EQ(replyError(reply), "invalid plugin path: " + missing);
  expectFound(findByUrl(thumbs()), kThumbsId, thumbs());
  expectNotFound(findByUrl(action()));
}

TEST_F(FindRequests, AddOfADirectoryThatIsNoBundleIsRefusedByTheRegistry) {
  fs::path empty = apps_ / "Empty.app";
  fs::create_directories(empty);
  Value reply = ask(pathsRequest("add", {Value(empty.string())}));
  EXPECT_EQ(replyErrorCode(reply), 2) << reply.description();
  EXPECT_EQ(replyError(reply), "unable to register plug-in at " + empty.string());
  EXPECT_TRUE(daemon_.logShows("failed to register plug-in at " + empty.string())) << daemon_.log();
}

TEST_F(FindRequests, AddResolvesThePathBeforeRegistering) {
  fs::create_directory_symlink(apps_, root_ / "Link");
  Value reply = ask(pathsRequest("add", {Value((root_ / "Link/./Viewer.app").string())}));
  ASSERT_EQ(replyErrorCode(reply), 0) << reply.description();
  expectFound(findByUrl(thumbs()), kThumbsId, thumbs());
}

TEST_F(FindRequests, AddWithMalformedPathsIsAnInvalidRequestFormat) {
  for (const Value& message : {request("add"), request("add", {{"paths", Value(viewer())}}),
                               pathsRequest("add", {Value(viewer()), Value(7)})}) {
    Value reply = ask(message);
    EXPECT_EQ(replyErrorCode(reply), 4) << message.description();
    EXPECT_EQ(replyError(reply), "invalid request format") << message.description();
  }
}

TEST_F(FindRequests, AddWithNoPathsSucceeds) {
  Value reply = ask(pathsRequest("add", {}));
  ASSERT_NE(reply.dictionary(), nullptr);
  EXPECT_TRUE(reply.dictionary()->empty()) << reply.description();
}

TEST_F(FindRequests, ReAddingARegisteredPathKeepsItsUuid) {
  addExamples();
  auto before = uuidOf(thumbs());
  ASSERT_TRUE(before);
  Value reply = ask(pathsRequest("add", {Value(viewer())}));
  ASSERT_EQ(replyErrorCode(reply), 0) << reply.description();
  auto after = uuidOf(thumbs());
  ASSERT_TRUE(after);
  EXPECT_EQ(*before, *after);
  expectFound(findByUuid(*before), kThumbsId, thumbs());
}

TEST_F(FindRequests, RemoveWithTheManagerEntitlementUnregistersEveryPlugInOfTheApplication) {
  addExamples();
  auto uuid = uuidOf(thumbs());
  ASSERT_TRUE(uuid);
  auto result = daemon_.ekctlAs(managerEkctl(), {"remove", viewer()});
  ASSERT_EQ(result.status, 0) << result.err << daemon_.log();
  expectNotFound(findByUrl(thumbs()));
  expectNotFound(findByUrl(viewerShare()));
  expectNotFound(findByUuid(*uuid));
  // The other application is untouched.
  expectFound(findByUrl(action()), kActionId, action());
}

TEST_F(FindRequests, RemoveWithoutTheEntitlementIsRefusedAndRemovesNothing) {
  addExamples();
  Value reply = ask(pathsRequest("remove", {Value(viewer())}));
  EXPECT_EQ(replyErrorCode(reply), 11);
  EXPECT_EQ(replyError(reply), "caller lacks entitlement for this operation");
  EXPECT_TRUE(daemon_.logShows("refused request from pid=" + std::to_string(getpid()) +
                               " to remove plug-in at " + viewer() +
                               " - client lacks required entitlement"))
      << daemon_.log();
  expectFound(findByUrl(thumbs()), kThumbsId, thumbs());
}

TEST_F(FindRequests, RemoveThroughPlainEkctlIsRefused) {
  addExamples();
  auto result = daemon_.ekctl({"remove", viewer()});
  EXPECT_EQ(result.status, 1);
  EXPECT_NE(result.err.find("ekctl: error 11: caller lacks entitlement for this operation"),
            std::string::npos)
      << result.err;
  expectFound(findByUrl(thumbs()), kThumbsId, thumbs());
}

TEST_F(FindRequests, RemoveOfANeverRegisteredPathIsNoPlugIn) {
  addExamples();
  fs::path other = apps_ / "Other.app";
  fs::copy(fs::path(EXAMPLES_DIR) / "Applications/Notes.app", other, fs::copy_options::recursive);
  auto result = daemon_.ekctlAs(managerEkctl(), {"remove", other.string()});
  EXPECT_EQ(result.status, 1);
  EXPECT_NE(result.err.find("ekctl: error 9: no plugin at " + other.string()), std::string::npos)
      << result.err;
}

TEST_F(FindRequests, RemoveStopsAtTheFirstUnknownPathAndKeepsEarlierRemovals) {
  addExamples();
  std::string missing = (apps_ / "Missing.app").string();
  auto result = daemon_.ekctlAs(managerEkctl(), {"remove", viewer(), missing, notes()});
  EXPECT_EQ(result.status, 1);
  EXPECT_NE(result.err.find("ekctl: error 9: no plugin at " + missing), std::string::npos)
      << result.err;
  expectNotFound(findByUrl(thumbs()));
  expectFound(findByUrl(action()), kActionId, action());
}

TEST_F(FindRequests, RemoveWithNoPathsSucceedsWithoutTheEntitlement) {
  Value reply = ask(pathsRequest("remove", {}));
  ASSERT_NE(reply.dictionary(), nullptr);
  EXPECT_TRUE(reply.dictionary()->empty()) << reply.description();
}

TEST_F(FindRequests, RemoveWithARelativePathIsRefusedBeforeTheEntitlementCheck) {
  Value reply = ask(pathsRequest("remove", {Value("Viewer.app")}));
  EXPECT_EQ(replyErrorCode(reply), 9);
  EXPECT_EQ(replyError(reply), "absolute path required: Viewer.app");
}

TEST_F(FindRequests, RemoveOfABundleDeletedFromDiskUnregistersItByThePathAsSent) {
  addExamples();
  fs::remove_all(viewer());
  auto result = daemon_.ekctlAs(managerEkctl(), {"remove", viewer()});
  EXPECT_EQ(result.status, 0) << result.err << daemon_.log();
  expectNotFound(findByUrl(thumbs()));
}

TEST_F(FindRequests, BulkWithFlagsZeroSucceedsAndLogsThatItIsNotSupported) {
  Value reply = ask(request("bulk", {{"flags", Value(0)}}));
  ASSERT_NE(reply.dictionary(), nullptr);
  EXPECT_TRUE(reply.dictionary()->empty()) << reply.description();
  EXPECT_NE(daemon_.log().find("bulk options 0x0 not supported"), std::string::npos)
      << daemon_.log();
}

TEST_F(FindRequests, BulkThroughEkctlLogsTheLow32BitsOfItsFlags) {
  auto result = daemon_.ekctl({"bulk", "--flags", std::to_string(0x1000000abULL)});
  EXPECT_EQ(result.status, 0) << result.err;
  EXPECT_NE(daemon_.log().find("bulk options 0xab not supported"), std::string::npos)
      << daemon_.log();
}

TEST_F(FindRequests, BulkWithoutFlagsReadsZero) {
  Value reply = ask(request("bulk"));
  EXPECT_EQ(replyErrorCode(reply), 0) << reply.description();
  EXPECT_NE(daemon_.log().find("bulk options 0x0 not supported"), std::string::npos)
      << daemon_.log();
}

// An application installed, removed and installed again while the daemon runs.
TEST_F(FindRequests, InstallRemoveAndReinstallWhileRunning) {
  fs::path installed = root_ / "Installed";
  fs::create_directories(installed);
  fs::copy(fs::path(EXAMPLES_DIR) / "Applications/Viewer.app", installed / "Viewer.app",
           fs::copy_options::recursive);
  std::string app = (installed / "Viewer.app").string();
  std::string plugIn = app + "/PlugIns/Thumbs.appex";

  ASSERT_EQ(replyErrorCode(ask(pathsRequest("add", {Value(app)}))), 0);
  auto first = uuidOf(plugIn);
  ASSERT_TRUE(first);
  expectFound(findByUuid(*first), kThumbsId, plugIn);

  auto result = daemon_.ekctlAs(managerEkctl(), {"remove", app});
  ASSERT_EQ(result.status, 0) << result.err << daemon_.log();
  expectNotFound(findByUrl(plugIn));
  expectNotFound(findByUuid(*first));

  ASSERT_EQ(replyErrorCode(ask(pathsRequest("add", {Value(app)}))), 0);
  auto second = uuidOf(plugIn);
  ASSERT_TRUE(second);
  expectFound(findByUuid(*second), kThumbsId, plugIn);
}

TEST_F(FindRequests, RegistrationsSurviveARestart) {
  addExamples();
  auto uuid = uuidOf(thumbs());
  ASSERT_TRUE(uuid);
  ASSERT_EQ(daemon_.terminate(), 0);
  ASSERT_TRUE(daemon_.start()) << daemon_.log();
  expectFound(findByUuid(*uuid), kThumbsId, thumbs());
}

}  // namespace
}  // namespace ek::test
