// Handlers driven through the request table, with no connection: the reply a request gets.
#include "ekd/Handlers.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <unistd.h>

#include <future>

#include "Ekora/EkProtocol.h"
#include "ekd/Duplicates.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "platform/cbor/Cbor.h"
#include "platform/testing/Files.h"
#include "platform/vantor/FakeRegistry.h"

namespace ek {
namespace {

using namespace protocol;

const Uuid kKnown = *Uuid::parse("6A0C3B1E-2F4D-4E8A-9B7C-1D2E3F405162");
const Uuid kUnknown = *Uuid::parse("00000000-0000-4000-8000-000000000001");
const std::string kShare = "/Applications/Host.app/PlugIns/Share.appex";

// Who sends a request: nobody in particular (no program, no entitlements), or this process
// holding the manager entitlement, outside or inside a sandbox.
enum class Sender { Nobody, Manager, SandboxedManager };

class HandlersTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ::setenv("EKORA_RUNTIME_DIR", dir_.path().c_str(), 1);
    ::setenv("EKORA_STATE_DIR", dir_.path().c_str(), 1);
    auto registry = std::make_shared<vantor::FakeRegistry>();
    vantor::PlugInProxy proxy;
    proxy.uuid = kKnown;
    proxy.identifier = proxy.originalIdentifier = "com.example.share";
    proxy.path = kShare;
    proxy.url = vantor::fileUrlForPath(proxy.path);
    proxy.containingAppPath = "/Applications/Host.app";
    proxy.dataContainerPath = "/var/lib/ekora/containers/com.example.share";
    Dictionary point{{"ZuExtensionPointIdentifier", Value("com.corvane.share")}};
    proxy.info = Dictionary{
        {"QvBundleIdentifier", Value(proxy.identifier)},
        {"ZuExtension", Value(Dictionary{{"ZuExtensionPointIdentifier", Value("com.corvane.share")},
                                         {"ZuExtensionAttributes", Value(point)}})}};
    registry->install(proxy);
    EkDPlatform platform;
    platform.codeSigning = codeSigning_;
    platform.sandbox = sandbox_;
    platform.registry = registry;
    platform.serviceManager = std::make_shared<stard::FakeServiceManager>();
    platform.notifier = std::make_shared<notify::FakeNotifier>();
    server_ = EkDServer::initForService("handlers-unit-server", std::nullopt, platform);
    ASSERT_TRUE(server_);
    nobody_ = EkDClientProcess::read(AuditToken{}, std::nullopt, *codeSigning_, nullptr);
    codeSigning_->setEntitlements(::getpid(), {{std::string(kEntitlementManager), Value(true)}});
    manager_ = EkDClientProcess::read(AuditToken::self(), executableIdForPid(::getpid()),
                                      *codeSigning_, sandbox_);
  }
  void TearDown() override { server_->stop(); }

  // The reply to a request, answered on the work queue as a connection's is.
  Reply answer(Sender sender, std::string_view type, const Dictionary& body,
               uint64_t version = kCurrentVersion) {
    const RequestHandler* handler = handlerFor(type);
    EXPECT_TRUE(handler) << type;
    if (!handler) return Reply{};
    sandbox_->setSandboxed(::getpid(), sender == Sender::SandboxedManager);
    const EkDClientProcess& process = sender == Sender::Nobody ? *nobody_ : *manager_;
    const Value request(body);
    const Request decoded{request, version, process, 0, nullptr};
    std::promise<Reply> replied;
    server_->mainQueue()->sync([&] {
      if (handler->answer) {
        replied.set_value(handler->answer(decoded, *server_));
      } else {
        handler->start(decoded, *server_,
                       [&](Reply reply) { replied.set_value(std::move(reply)); });
      }
    });
    return replied.get_future().get();
  }

  testing::TempDir dir_{"ekd-handlers"};
  std::shared_ptr<FakeCodeSigning> codeSigning_ = std::make_shared<FakeCodeSigning>();
  std::shared_ptr<FakeSandboxCheck> sandbox_ = std::make_shared<FakeSandboxCheck>();
  std::shared_ptr<const EkDClientProcess> nobody_, manager_;
  std::shared_ptr<EkDServer> server_;
};

struct Case {
  const char* name;
  Sender sender;
  std::string_view type;
  Dictionary body;
  int32_t code;                  // 0: answered without an error
  std::string_view member = "";  // a member the answer carries, if any
  uint64_t version = kCurrentVersion;
};

TEST_F(HandlersTest, RepliesToEachShapeOfRequest) {
  const std::string uuids(kUuids), paths(kPaths), annotations(kAnnotations), rules(kRules),
      flags(kFlags);
  const Value url("file://" + kShare), slashed("file://" + kShare + "/"), nowhere("file:///a");
  const Value elect(Dictionary{{"election", Value(true)}});
  const Value textElection(Dictionary{{"election", Value("1")}});
  const Value dir(dir_.path()), missing(dir_.file("missing"));
  const auto N = Sender::Nobody, M = Sender::Manager, S = Sender::SandboxedManager;
  const Value known(kKnown), known1(Array{known}), unknown1(Array{Value(kUnknown)});
  const Value all(kDiscoverAll), manyPaths(Array(10001, dir)), manyUuids(Array(10001, known));
  const int32_t invalid = kErrorInvalidRequest, denied = kErrorNotPermitted;
  const int32_t absent = kErrorNotFound, badPath = kErrorBadPath;
  const Case cases[] = {
      {"find by a known UUID", N, kFind, {{uuids, known}}, 0, kMatches},
      {"find by URL", N, kFind, {{paths, url}}, 0, kMatches},
      {"find by URL with a trailing slash", N, kFind, {{paths, slashed}}, 0, kMatches},
      {"find of version 2 answers no form", N, kFind, {{uuids, known}}, 0, "", 2},
      {"find by an unknown UUID", N, kFind, {{uuids, Value(kUnknown)}}, absent},
      {"find naming nothing", N, kFind, {}, absent},
      {"find by UUIDs as an array", N, kFind, {{uuids, known1}}, absent},
      {"find by a UUID as text", N, kFind, {{uuids, Value(kKnown.string())}}, absent},
      {"find by paths as an array", N, kFind, {{paths, Value(Array{url})}}, absent},
      {"find by a bare path", N, kFind, {{paths, Value(kShare)}}, absent},
      {"find: the path decides", N, kFind, {{uuids, known}, {paths, nowhere}}, absent},
      {"match without rules", N, kMatch, {}, 0, kMatches},
      {"match with rules that are no dictionary", N, kMatch, {{rules, Value("x")}}, invalid},
      {"match of version 2 answers no forms", N, kMatch, {}, 0, "", 2},
      {"match of everything by nobody", N, kMatch, {{flags, all}}, denied},
      {"match of everything by a manager", M, kMatch, {{flags, all}}, 0, kMatches},
      {"match of everything by a sandboxed manager", S, kMatch, {{flags, all}}, denied},
      {"annotate without annotations", N, kAnnotate, {}, invalid},
      {"annotate with an election of text", N, kAnnotate, {{annotations, textElection}}, invalid},
      {"annotate with nothing to change", N, kAnnotate, {{annotations, Value(Dictionary{})}}, 0},
      {"annotate without UUIDs", N, kAnnotate, {{annotations, elect}}, invalid},
      {"annotate the unknown", N, kAnnotate, {{annotations, elect}, {uuids, unknown1}}, invalid},
      {"annotate a known plug-in", N, kAnnotate, {{annotations, elect}, {uuids, known1}}, 0},
      {"add without paths", N, kAdd, {}, invalid},
      {"add of paths that are no array", N, kAdd, {{paths, dir}}, invalid},
      {"add of a path that is no text", N, kAdd, {{paths, Value(Array{Value(7)})}}, invalid},
      {"add of a relative path", N, kAdd, {{paths, Value(Array{dir, Value("a/b")})}}, badPath},
      {"add of a missing path", N, kAdd, {{paths, Value(Array{missing})}}, badPath},
      {"add of no paths", N, kAdd, {{paths, Value(Array{})}}, 0},
      {"add of a directory", N, kAdd, {{paths, Value(Array{dir, dir})}}, 0},
      {"remove by nobody", N, kRemove, {{paths, Value(Array{dir})}}, denied},
      {"remove of no paths by nobody", N, kRemove, {{paths, Value(Array{})}}, 0},
      {"remove of a relative path", N, kRemove, {{paths, Value(Array{Value("a")})}}, badPath},
      {"remove by a manager", M, kRemove, {{paths, Value(Array{dir, missing})}}, 0},
      // Lists are bounded at 10,000 entries; copies of one path cost one registration.
      {"add of 10,000 paths", N, kAdd, {{paths, Value(Array(10000, dir))}}, 0},
      {"add of 10,001 paths", N, kAdd, {{paths, manyPaths}}, invalid},
      {"remove of 10,001 paths", M, kRemove, {{paths, manyPaths}}, invalid},
      {"access to 10,001 plug-ins", N, kAccess, {{uuids, manyUuids}}, invalid},
      {"ready of 10,001 plug-ins", N, kReady, {{uuids, manyUuids}}, invalid},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    Reply reply = answer(c.sender, c.type, c.body, c.version);
    EXPECT_EQ(reply.failed() ? reply.error->code : 0, c.code);
    if (c.member.empty()) {
      EXPECT_FALSE(reply.writeEncoded);
      continue;
    }
    // The member written straight in its encoding: one form, or an array of forms.
    ASSERT_EQ(reply.encodedKey, c.member);
    std::vector<uint8_t> encoded;
    reply.writeEncoded(encoded);
    Result<Value> written = cbor::decode(encoded);
    ASSERT_TRUE(written.ok());
    const Value* form = written->array() ? &written->array()->at(0) : &*written;
    EXPECT_EQ(*form->getString("uuid"), kKnown.string());
  }
  // The one annotation accepted is stored, its election as the number it stands for.
  std::optional<Dictionary> stored;
  server_->mainQueue()->sync([&] {
    stored = server_->database().annotationForPlugIn(*server_->database().findPlugIn(kKnown));
  });
  EXPECT_EQ(stored, (Dictionary{{"election", Value(uint64_t{1})}}));
}  // namespace

// De-duplication of the copies of one identifier, fed in the registry's order.
TEST(DuplicateFilter, KeepsOneCopyPerIdentifierUnlessTheFlagsKeepMore) {
  struct Copy {
    const char* version;  // nullptr: none
    bool system = false;
    int32_t modified = 0;
    const char* identifier = "a";  // nullptr: none
  };
  struct Row {
    const char* name;
    uint64_t flags;
    std::vector<Copy> copies;
    std::vector<int> kept;  // the copies the reply keeps, in order
  };
  const uint64_t versions = kDiscoverKeepVersions, duplicates = kDiscoverKeepDuplicates;
  const Row rows[] = {
      {"the greater version wins, by number", 0, {{"1.2"}, {"1.10"}}, {1}},
      {"the greater version wins also when it comes first", 0, {{"1.10"}, {"1.2"}}, {0}},
      {"keeping duplicates alone keeps one version", duplicates, {{"1.2"}, {"1.10"}}, {1}},
      {"keeping versions keeps each", versions, {{"1.2"}, {"1.10"}}, {0, 1}},
      {"of one version the later modified wins", 0, {{"2", false, 1}, {"2", false, 2}}, {1}},
      {"of one version the later modified wins also first",
       0,
       {{"2", false, 2}, {"2", false, 1}},
       {0}},
      {"keeping versions keeps one copy of each",
       versions,
       {{"2", false, 2}, {"2", false, 1}},
       {0}},
      {"keeping versions and duplicates keeps every copy",
       versions | duplicates,
       {{"2", false, 2}, {"2", false, 1}},
       {0, 1}},
      {"a system copy wins over a later modified one", 0, {{"2", false, 9}, {"2", true, 1}}, {1}},
      {"a system copy wins when it comes first", versions, {{"2", true, 1}, {"2", false, 9}}, {0}},
      {"a greater version wins over a system copy", 0, {{"2", true}, {"2.1", false}}, {1}},
      {"no version equals any", 0, {{"2", false, 1}, {nullptr, false, 2}}, {1}},
      {"an earlier copy is replaced in its place",
       versions,
       {{"1", false, 1}, {"2", false, 1}, {"1", false, 2}},
       {1, 2}},
      {"other identifiers are not weighed", 0, {{"2"}, {"2", false, 0, "b"}}, {0, 1}},
      {"copies without identifier are all kept",
       0,
       {{"2", false, 0, nullptr}, {"2", false, 0, nullptr}},
       {0, 1}},
  };
  for (const Row& row : rows) {
    DuplicateFilter filter(row.flags);
    std::vector<int> kept;  // per position, the copy there (-1 once replaced)
    for (size_t i = 0; i < row.copies.size(); ++i) {
      const Copy& copy = row.copies[i];
      const Value version(copy.version ? copy.version : "");
      auto identifier =
          copy.identifier ? std::optional<std::string>(copy.identifier) : std::nullopt;
      auto verdict =
          filter.admit({identifier, copy.version ? &version : nullptr, copy.system, copy.modified});
      if (verdict.replaces) kept.at(*verdict.replaces) = -1;
      if (verdict.kept) kept.push_back(static_cast<int>(i));
    }
    std::erase(kept, -1);
    EXPECT_EQ(kept, row.kept) << row.name;
  }
}

}  // namespace
}  // namespace ek
