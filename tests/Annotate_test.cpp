// Changing plug-ins' annotations on a running daemon: "annotate" and "bulk-annotate", what
// reaches the annotation file, what is posted and what "find" hands back.
#include <gtest/gtest.h>
#include <unistd.h>

#include "platform/dmap/Dmap.h"
#include "platform/value/Uuid.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;

constexpr const char* kManager = "com.corvane.private.ekora.manager";
constexpr const char* kChange = "com.corvane.ekora.annotation-change";
constexpr const char* kThumbsId = "com.corvane.example.viewer.thumbs";
constexpr const char* kViewerShareId = "com.corvane.example.viewer.share";
constexpr const char* kActionId = "com.corvane.example.notes.action";

Value uuidArray(const std::vector<Uuid>& uuids) {
  Array array;
  for (const Uuid& uuid : uuids) array.emplace_back(uuid);
  return Value(std::move(array));
}

Value annotate(Dictionary annotations, Value uuids) {
  return request("annotate",
                 {{"annotations", Value(std::move(annotations))}, {"uuids", std::move(uuids)}});
}

Value bulkAnnotate(Dictionary annotations) {
  return request("bulk-annotate", {{"annotations", Value(std::move(annotations))}});
}

class AnnotateRequests : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = fs::canonical(daemon_.root().path());
    fs::path apps = root_ / "Applications";
    fs::create_directories(apps);
    for (const char* app : {"Viewer.app", "Notes.app"}) {
      fs::copy(fs::path(EXAMPLES_DIR) / "Applications" / app, apps / app,
               fs::copy_options::recursive);
    }
    viewer_ = (apps / "Viewer.app").string();
    notes_ = (apps / "Notes.app").string();
    thumbsPath_ = viewer_ + "/PlugIns/Thumbs.appex";
    ASSERT_TRUE(daemon_.start()) << daemon_.log();
    Value added = ask(request("add", {{"paths", Value(Array{Value(viewer_), Value(notes_)})}}));
    ASSERT_EQ(replyErrorCode(added), 0) << added.description();
    auto thumbs = uuidOf(thumbsPath_);
    auto share = uuidOf(viewer_ + "/PlugIns/Share.appex");
    auto action = uuidOf(notes_ + "/PlugIns/Action.appex");
    ASSERT_TRUE(thumbs && share && action) << daemon_.log();
    thumbs_ = *thumbs;
    share_ = *share;
    action_ = *action;
  }
  void TearDown() override {
    if (daemon_.running()) {
      EXPECT_EQ(daemon_.terminate(), 0) << daemon_.log();
    }
  }

  Value ask(const Value& message) {
    auto reply = daemon_.ask(message);
    EXPECT_TRUE(reply.has_value()) << "no reply to " << message.description().substr(0, 200) << "\n"
                                   << daemon_.log();
    return reply ? *reply : Value(Dictionary{{"errorcode", Value(uint64_t{999})}});
  }

  std::optional<Uuid> uuidOf(const std::string& path) {
    Value reply = ask(request("find", {{"paths", Value("file://" + path)}}));
    const Value* form = reply.get("matches");
    if (!form || !form->getString("uuid")) return std::nullopt;
    return Uuid::parse(*form->getString("uuid"));
  }

  // The "annotations" of the plug-in's form as "find" answers it.
  Value foundAnnotations(const Uuid& uuid) {
    Value reply = ask(request("find", {{"uuids", Value(uuid)}}));
    const Value* form = reply.get("matches");
    const Value* annotations = form ? form->get("annotations") : nullptr;
    EXPECT_NE(annotations, nullptr) << reply.description();
    return annotations ? *annotations : Value("<absent>");
  }

  // The file's "data"; fails the test when the file is not a version 16 annotation file.
  Dictionary storedData() {
    auto file = dmap::readFile(daemon_.annotationFile());
    if (!file) {
      ADD_FAILURE() << "annotation file unreadable: " << file.error().message;
      return {};
    }
    const uint64_t* version = file.value().getUnsigned("version");
    EXPECT_TRUE(version && *version == 16) << file.value().description();
    const Dictionary* data = file.value().getDictionary("data");
    EXPECT_NE(data, nullptr) << file.value().description();
    return data ? *data : Dictionary{};
  }
  // The stored annotation of one plug-in identifier; absent when there is none (or no file).
  std::optional<Value> stored(const std::string& identifier) {
    if (!fs::exists(daemon_.annotationFile())) return std::nullopt;
    Dictionary data = storedData();
    auto it = data.find(identifier);
    if (it == data.end()) return std::nullopt;
    return it->second;
  }

  uint64_t posts() const { return daemon_.notificationGeneration(kChange); }

  static void expectFailure(const Value& reply, int64_t code, const std::string& message) {
    EXPECT_EQ(replyErrorCode(reply), code) << reply.description();
    EXPECT_EQ(replyError(reply), message);
  }
  static void expectSuccess(const Value& reply) {
    ASSERT_NE(reply.dictionary(), nullptr);
    EXPECT_TRUE(reply.dictionary()->empty()) << reply.description();
  }

  EkdProcess daemon_;
  fs::path root_;
  std::string viewer_, notes_, thumbsPath_;
  Uuid thumbs_, share_, action_;
};

const Value kElected(Dictionary{{"election", Value(1)}});

TEST_F(AnnotateRequests, ElectionForTwoPlugInsIsStoredForBothAndPostedOnce) {
  uint64_t before = posts();
  expectSuccess(ask(annotate({{"election", Value(1)}}, uuidArray({thumbs_, share_}))));
  EXPECT_EQ(posts(), before + 1);
  EXPECT_EQ(stored(kThumbsId), kElected);
  EXPECT_EQ(stored(kViewerShareId), kElected);
  EXPECT_EQ(stored(kActionId), std::nullopt);
  std::string log = daemon_.log();
  std::string pid = std::to_string(getpid());
  for (const auto& [id, uuid] :
       {std::pair{kThumbsId, thumbs_}, std::pair{kViewerShareId, share_}}) {
    EXPECT_NE(
        log.find("client " + pid + " plug-in " + id + "(" + uuid.string() + ") election := 1"),
        std::string::npos)
        << log;
  }
}

TEST_F(AnnotateRequests, EkctlAnnotateStoresTheElection) {
  uint64_t before = posts();
  auto result = daemon_.ekctl(
      {"annotate", "--set", R"({"election": 1})", thumbs_.string(), action_.string()});
  ASSERT_EQ(result.status, 0) << result.err << daemon_.log();
  EXPECT_EQ(posts(), before + 1);
  EXPECT_EQ(stored(kThumbsId), kElected);
  EXPECT_EQ(stored(kActionId), kElected);
}

TEST_F(AnnotateRequests, AnnotationsFileIsAtTheDefaultLocationInTheStateDirectory) {
  expectSuccess(ask(annotate({{"election", Value(1)}}, uuidArray({thumbs_}))));
  EXPECT_TRUE(fs::is_regular_file(root_ / "state/Ekora-Annotations"));
}

TEST_F(AnnotateRequests, OnlyUnknownKeysSucceedWithoutReadingUuidsOrPosting) {
  uint64_t before = posts();
  expectSuccess(
      ask(annotate({{"colour", Value("red")}, {"Election", Value(1)}}, Value("garbage"))));
  EXPECT_EQ(posts(), before);
  EXPECT_FALSE(fs::exists(daemon_.annotationFile()));
}

TEST_F(AnnotateRequests, UnknownKeysAreNotStoredBesideKnownOnes) {
  expectSuccess(
      ask(annotate({{"colour", Value("red")}, {"election", Value(1)}}, uuidArray({thumbs_}))));
  EXPECT_EQ(stored(kThumbsId), kElected);
}

TEST_F(AnnotateRequests, ElectionThatIsNotANumberChangesNothing) {
  uint64_t before = posts();
  expectFailure(ask(annotate({{"election", Value("1")}}, uuidArray({thumbs_}))), 4,
                "invalid request format (annotation election)");
  EXPECT_EQ(posts(), before);
  EXPECT_FALSE(fs::exists(daemon_.annotationFile()));
  EXPECT_EQ(foundAnnotations(thumbs_), Value(Dictionary{}));
}

TEST_F(AnnotateRequests, ElectionIsCheckedBeforeExtensionAndUuids) {
  expectFailure(ask(annotate({{"election", Value("yes")}, {"extension", Value(5)}}, Value("x"))), 4,
                "invalid request format (annotation election)");
}

TEST_F(AnnotateRequests, ExtensionThatIsNotADictionaryChangesNothing) {
  uint64_t before = posts();
  expectFailure(ask(annotate({{"election", Value(1)}, {"extension", Value(Array{Value(1)})}},
                             uuidArray({thumbs_}))),
                4, "invalid request format (annotation extension)");
  EXPECT_EQ(posts(), before);
  EXPECT_FALSE(fs::exists(daemon_.annotationFile()));
}

TEST_F(AnnotateRequests, MissingOrMalformedAnnotationsIsABadAnnotationsDictionary) {
  for (const Value& message :
       {request("annotate", {{"uuids", uuidArray({thumbs_})}}),
        request("annotate", {{"annotations", Value(Array{})}, {"uuids", uuidArray({thumbs_})}}),
        request("annotate", {{"annotations", Value("election")}})}) {
    expectFailure(ask(message), 4, "invalid request format (bad annotations dictionary)");
  }
  EXPECT_FALSE(fs::exists(daemon_.annotationFile()));
}

TEST_F(AnnotateRequests, UuidsThatAreNotAnArrayAreAnInvalidFormat) {
  uint64_t before = posts();
  for (const Value& message : {annotate({{"election", Value(1)}}, Value(thumbs_)),
                               annotate({{"election", Value(1)}}, Value(thumbs_.string())),
                               request("annotate", {{"annotations", Value(kElected)}})}) {
    expectFailure(ask(message), 4, "invalid request format (uuid)");
  }
  EXPECT_EQ(posts(), before);
  EXPECT_FALSE(fs::exists(daemon_.annotationFile()));
}

TEST_F(AnnotateRequests, BadThirdElementFailsAfterTheFirstTwoWereStored) {
  uint64_t before = posts();
  Array uuids{Value(thumbs_), Value(share_), Value(action_.string()), Value(action_)};
  expectFailure(ask(annotate({{"election", Value(1)}}, Value(uuids))), 4,
                "invalid request (bad uuid array)");
  EXPECT_EQ(posts(), before);
  EXPECT_EQ(stored(kThumbsId), kElected);
  EXPECT_EQ(stored(kViewerShareId), kElected);
  EXPECT_EQ(stored(kActionId), std::nullopt);
}

TEST_F(AnnotateRequests, UnknownUuidResolvesThroughItsPath) {
  uint64_t before = posts();
  Value message = request("annotate", {{"annotations", Value(kElected)},
                                       {"uuids", uuidArray({Uuid::random(), action_})},
                                       {"paths", Value(Array{Value(thumbsPath_), Value(7)})}});
  expectSuccess(ask(message));
  EXPECT_EQ(posts(), before + 1);
  EXPECT_EQ(stored(kThumbsId), kElected);
  EXPECT_EQ(stored(kActionId), kElected);
}

TEST_F(AnnotateRequests, PathsOfAnotherCountAreIgnored) {
  uint64_t before = posts();
  Value message = request("annotate", {{"annotations", Value(kElected)},
                                       {"uuids", uuidArray({Uuid::random(), action_})},
                                       {"paths", Value(Array{Value(thumbsPath_)})}});
  expectFailure(ask(message), 4, "no such plugin (uuid not found)");
  EXPECT_EQ(posts(), before);
  EXPECT_EQ(stored(kThumbsId), std::nullopt);
  EXPECT_EQ(stored(kActionId), std::nullopt);
}

TEST_F(AnnotateRequests, PathsThatAreNotAnArrayAreIgnored) {
  Value message = request("annotate", {{"annotations", Value(kElected)},
                                       {"uuids", uuidArray({Uuid::random()})},
                                       {"paths", Value(thumbsPath_)}});
  expectFailure(ask(message), 4, "no such plugin (uuid not found)");
  EXPECT_EQ(stored(kThumbsId), std::nullopt);
}

TEST_F(AnnotateRequests, PathElementThatIsNotAStringGivesNoFallback) {
  Value message = request("annotate", {{"annotations", Value(kElected)},
                                       {"uuids", uuidArray({thumbs_, Uuid::random()})},
                                       {"paths", Value(Array{Value(thumbsPath_), Value(false)})}});
  expectFailure(ask(message), 4, "no such plugin (uuid not found)");
  // The first entry was handled before the walk stopped.
  EXPECT_EQ(stored(kThumbsId), kElected);
}

TEST_F(AnnotateRequests, PathOfNoPlugInGivesNoFallback) {
  Value message =
      request("annotate", {{"annotations", Value(kElected)},
                           {"uuids", uuidArray({Uuid::random()})},
                           {"paths", Value(Array{Value(viewer_ + "/PlugIns/None.appex")})}});
  expectFailure(ask(message), 4, "no such plugin (uuid not found)");
}

TEST_F(AnnotateRequests, DuplicateUuidsAreFine) {
  uint64_t before = posts();
  expectSuccess(ask(annotate({{"election", Value(1)}}, uuidArray({thumbs_, thumbs_, thumbs_}))));
  EXPECT_EQ(posts(), before + 1);
  EXPECT_EQ(stored(kThumbsId), kElected);
}

TEST_F(AnnotateRequests, EmptyUuidListSucceedsAndPosts) {
  uint64_t before = posts();
  expectSuccess(ask(annotate({{"election", Value(1)}}, Value(Array{}))));
  EXPECT_EQ(posts(), before + 1);
  EXPECT_EQ(stored(kThumbsId), std::nullopt);
}

// The longest list a request may carry.
TEST_F(AnnotateRequests, TenThousandCopiesOfOneUuidAreAnswered) {
  Array uuids(10000, Value(thumbs_));
  auto reply = daemon_.ask(annotate({{"election", Value(1)}}, Value(std::move(uuids))),
                           std::chrono::seconds(30));
  ASSERT_TRUE(reply.has_value()) << "no reply within 30 s";
  expectSuccess(*reply);
  EXPECT_EQ(stored(kThumbsId), kElected);
  EXPECT_EQ(foundAnnotations(thumbs_), kElected);
}

TEST_F(AnnotateRequests, TenThousandUnknownUuidsAreAnswered) {
  Array uuids;
  uuids.reserve(10000);
  for (int i = 0; i < 10000; ++i) uuids.emplace_back(Uuid::random());
  auto reply = daemon_.ask(annotate({{"election", Value(1)}}, Value(std::move(uuids))),
                           std::chrono::seconds(30));
  ASSERT_TRUE(reply.has_value()) << "no reply within 30 s";
  expectFailure(*reply, 4, "no such plugin (uuid not found)");
  EXPECT_EQ(foundAnnotations(thumbs_), Value(Dictionary{}));
}

TEST_F(AnnotateRequests, ExtensionAloneIsStoredWithoutAnElection) {
  Dictionary extension{{"colour", Value("red")}, {"sizes", Value(Array{Value(1), Value(2)})}};
  expectSuccess(ask(annotate({{"extension", Value(extension)}}, uuidArray({thumbs_}))));
  EXPECT_EQ(stored(kThumbsId), Value(Dictionary{{"extension", Value(extension)}}));
}

TEST_F(AnnotateRequests, ElectionValuesAreStoredUnchanged) {
  expectSuccess(ask(annotate({{"election", Value(0x1ff)}}, uuidArray({thumbs_}))));
  EXPECT_EQ(stored(kThumbsId), Value(Dictionary{{"election", Value(0x1ff)}}));
  EXPECT_EQ(foundAnnotations(thumbs_), Value(Dictionary{{"election", Value(0x1ff)}}));
}

TEST_F(AnnotateRequests, ChangingTheElectionKeepsTheExtension) {
  Dictionary extension{{"n", Value(1)}};
  expectSuccess(ask(
      annotate({{"election", Value(0)}, {"extension", Value(extension)}}, uuidArray({thumbs_}))));
  expectSuccess(ask(annotate({{"election", Value(1)}}, uuidArray({thumbs_}))));
  Value expected(Dictionary{{"election", Value(1)}, {"extension", Value(extension)}});
  EXPECT_EQ(stored(kThumbsId), expected);
  EXPECT_EQ(foundAnnotations(thumbs_), expected);
}

TEST_F(AnnotateRequests, ChangingTheExtensionReplacesItWholeAndKeepsTheElection) {
  expectSuccess(
      ask(annotate({{"election", Value(1)}, {"extension", Value(Dictionary{{"a", Value(1)}})}},
                   uuidArray({thumbs_}))));
  expectSuccess(
      ask(annotate({{"extension", Value(Dictionary{{"b", Value(2)}})}}, uuidArray({thumbs_}))));
  EXPECT_EQ(
      stored(kThumbsId),
      Value(Dictionary{{"election", Value(1)}, {"extension", Value(Dictionary{{"b", Value(2)}})}}));
}

TEST_F(AnnotateRequests, FindHandsBackTheStoredAnnotations) {
  Dictionary extension{{"label", Value("mine")}};
  expectSuccess(ask(
      annotate({{"election", Value(1)}, {"extension", Value(extension)}}, uuidArray({action_}))));
  Value expected(Dictionary{{"election", Value(1)}, {"extension", Value(extension)}});
  EXPECT_EQ(foundAnnotations(action_), expected);
  EXPECT_EQ(foundAnnotations(thumbs_), Value(Dictionary{}));
}

TEST_F(AnnotateRequests, ElectionsSurviveADaemonRestart) {
  expectSuccess(ask(annotate({{"election", Value(1)}}, uuidArray({thumbs_}))));
  expectSuccess(ask(annotate({{"election", Value(2)}}, uuidArray({action_}))));
  ASSERT_EQ(daemon_.terminate(), 0);
  ASSERT_TRUE(daemon_.start()) << daemon_.log();
  EXPECT_EQ(foundAnnotations(thumbs_), kElected);
  EXPECT_EQ(foundAnnotations(action_), Value(Dictionary{{"election", Value(2)}}));
  EXPECT_EQ(foundAnnotations(share_), Value(Dictionary{}));
}

TEST_F(AnnotateRequests, ElectionSurvivesRemovingAndReAddingThePlugIn) {
  expectSuccess(ask(annotate({{"election", Value(1)}}, uuidArray({thumbs_}))));
  std::string manager = ekctlWithEntitlements(root_ / "manager", {kManager});
  auto removed = daemon_.ekctlAs(manager, {"remove", viewer_});
  ASSERT_EQ(removed.status, 0) << removed.err << daemon_.log();
  expectSuccess(ask(request("add", {{"paths", Value(Array{Value(viewer_)})}})));
  auto uuid = uuidOf(thumbsPath_);
  ASSERT_TRUE(uuid);
  EXPECT_EQ(foundAnnotations(*uuid), kElected);
}

TEST_F(AnnotateRequests, BulkAnnotateWithNoEntriesSucceedsAndPosts) {
  uint64_t before = posts();
  expectSuccess(ask(bulkAnnotate({})));
  EXPECT_EQ(posts(), before + 1);
}

TEST_F(AnnotateRequests, BulkAnnotateEkctlSetsEachExtension) {
  uint64_t before = posts();
  std::string json =
      "{\"" + thumbs_.string() + "\": {\"a\": 1}, \"" + action_.string() + "\": {\"b\": \"two\"}}";
  auto result = daemon_.ekctl({"bulk-annotate", json});
  ASSERT_EQ(result.status, 0) << result.err << daemon_.log();
  EXPECT_EQ(posts(), before + 1);
  EXPECT_EQ(stored(kThumbsId),
            Value(Dictionary{{"extension", Value(Dictionary{{"a", Value(1)}})}}));
  EXPECT_EQ(stored(kActionId),
            Value(Dictionary{{"extension", Value(Dictionary{{"b", Value("two")}})}}));
}

TEST_F(AnnotateRequests, BulkAnnotateStopsAtAnUnknownUuidKeepingEarlierEntries) {
  // Entries are handled in key order; no upper-case UUID text sorts after this one.
  std::string unknown = "FFFFFFFF-FFFF-4FFF-BFFF-FFFFFFFFFFFF";
  ASSERT_LT(thumbs_.string(), unknown);
  uint64_t before = posts();
  Dictionary extension{{"n", Value(1)}};
  expectFailure(ask(bulkAnnotate({{thumbs_.string(), Value(extension)},
                                  {unknown, Value(Dictionary{{"n", Value(2)}})}})),
                2, "no plug-in with the requested uuid");
  EXPECT_EQ(posts(), before);
  EXPECT_EQ(stored(kThumbsId), Value(Dictionary{{"extension", Value(extension)}}));
}

TEST_F(AnnotateRequests, BulkAnnotateValueThatIsNotADictionaryIsRefused) {
  uint64_t before = posts();
  expectFailure(ask(bulkAnnotate({{thumbs_.string(), Value(1)}})), 18,
                "annotations values must be dictionaries");
  // The value is looked at before the key.
  expectFailure(ask(bulkAnnotate({{"not a uuid", Value("x")}})), 18,
                "annotations values must be dictionaries");
  EXPECT_EQ(posts(), before);
  EXPECT_EQ(stored(kThumbsId), std::nullopt);
}

TEST_F(AnnotateRequests, BulkAnnotateKeyThatIsNotAUuidIsRefused) {
  expectFailure(ask(bulkAnnotate({{"not a uuid", Value(Dictionary{})}})), 18,
                "invalid plug-in UUID value");
  expectFailure(ask(bulkAnnotate({{thumbs_.string() + "0", Value(Dictionary{})}})), 18,
                "invalid plug-in UUID value");
}

TEST_F(AnnotateRequests, BulkAnnotateAcceptsLowerCaseUuidKeys) {
  std::string lower = thumbs_.string();
  for (char& c : lower) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  ASSERT_NE(lower, thumbs_.string());
  expectSuccess(ask(bulkAnnotate({{lower, Value(Dictionary{{"x", Value(1)}})}})));
  EXPECT_EQ(stored(kThumbsId),
            Value(Dictionary{{"extension", Value(Dictionary{{"x", Value(1)}})}}));
}

TEST_F(AnnotateRequests, BulkAnnotateMissingAnnotationsIsABadAnnotationsDictionary) {
  expectFailure(ask(request("bulk-annotate")), 4,
                "invalid request format (bad annotations dictionary)");
  expectFailure(ask(request("bulk-annotate", {{"annotations", Value(Array{})}})), 4,
                "invalid request format (bad annotations dictionary)");
}

TEST_F(AnnotateRequests, BulkAnnotateNeverChangesTheElection) {
  expectSuccess(ask(annotate({{"election", Value(1)}}, uuidArray({thumbs_}))));
  Dictionary value{{"election", Value(0)}};
  expectSuccess(ask(bulkAnnotate({{thumbs_.string(), Value(value)}})));
  Value expected(Dictionary{{"election", Value(1)}, {"extension", Value(value)}});
  EXPECT_EQ(stored(kThumbsId), expected);
  EXPECT_EQ(foundAnnotations(thumbs_), expected);
}

TEST_F(AnnotateRequests, AnnotationsOfOnePlugInLeaveOthersAlone) {
  expectSuccess(ask(annotate({{"election", Value(1)}}, uuidArray({thumbs_}))));
  expectSuccess(ask(annotate({{"election", Value(2)}}, uuidArray({share_}))));
  Dictionary data = storedData();
  EXPECT_EQ(data, (Dictionary{{kThumbsId, kElected},
                              {kViewerShareId, Value(Dictionary{{"election", Value(2)}})}}));
}

}  // namespace
}  // namespace ek::test
