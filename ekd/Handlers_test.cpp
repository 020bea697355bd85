// Handlers driven through the request table, with no connection: the reply a request gets.
#include "ekd/Handlers.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>

#include "Ekora/EkProtocol.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "platform/cbor/Cbor.h"
#include "platform/vantor/FakeRegistry.h"

namespace ek {
namespace {

namespace fs = std::filesystem;
using namespace protocol;

const Uuid kKnown = *Uuid::parse("6A0C3B1E-2F4D-4E8A-9B7C-1D2E3F405162");
const Uuid kUnknown = *Uuid::parse("00000000-0000-4000-8000-000000000001");

class HandlersTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/ekd-handlers-XXXXXX";
    ASSERT_TRUE(::mkdtemp(pattern));
    dir_ = pattern;
    ::setenv("EKORA_RUNTIME_DIR", dir_.c_str(), 1);
    ::setenv("EKORA_STATE_DIR", dir_.c_str(), 1);
    auto registry = std::make_shared<vantor::FakeRegistry>();
    vantor::PlugInProxy proxy;
    proxy.uuid = kKnown;
    proxy.identifier = proxy.originalIdentifier = "com.example.share";
    proxy.path = "/Applications/Host.app/PlugIns/Share.appex";
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
    platform.sandbox = std::make_shared<FakeSandboxCheck>();
    platform.registry = registry;
    platform.serviceManager = std::make_shared<stard::FakeServiceManager>();
    platform.notifier = std::make_shared<notify::FakeNotifier>();
    server_ = EkDServer::initForService("handlers-unit-server", std::nullopt, platform);
    ASSERT_TRUE(server_);
    // Nobody in particular: no program, no entitlements.
    sender_ = EkDClientProcess::read(AuditToken{}, std::nullopt, *codeSigning_, nullptr);
  }
  void TearDown() override {
    server_->stop();
    std::error_code ignored;
    fs::remove_all(dir_, ignored);
  }

  // The reply to a request of type with body, answered on the work queue as a connection's is.
  Reply answer(std::string_view type, const Dictionary& body) {
    const RequestHandler* handler = handlerFor(type);
    EXPECT_TRUE(handler && handler->answer) << type;
    const Value request(body);
    Reply reply;
    server_->mainQueue()->sync([&] {
      reply = handler->answer({request, kCurrentVersion, *sender_, 0, nullptr}, *server_);
    });
    return reply;
  }

  std::string dir_;
  std::shared_ptr<FakeCodeSigning> codeSigning_ = std::make_shared<FakeCodeSigning>();
  std::shared_ptr<const EkDClientProcess> sender_;
  std::shared_ptr<EkDServer> server_;
};

struct Case {
  const char* name;
  std::string_view type;
  Dictionary body;
  int32_t code;             // 0: answered without an error
  std::string_view member;  // a member the answer carries, if any
};

TEST_F(HandlersTest, RepliesOfFindAndAnnotate) {
  const std::string uuids(kUuids);
  const std::string annotations(kAnnotations);
  const Dictionary elect{{"election", Value(uint64_t{1})}};
  const Case cases[] = {
      {"find by a known UUID", kFind, {{uuids, Value(kKnown)}}, 0, kMatches},
      {"find by an unknown UUID", kFind, {{uuids, Value(kUnknown)}}, kErrorNotFound, ""},
      {"find naming nothing", kFind, {}, kErrorNotFound, ""},
      {"find by a path that is no URL",
       kFind,
       {{uuids, Value(kKnown)}, {"paths", Value("no url")}},
       kErrorNotFound,
       ""},
      {"annotate without annotations", kAnnotate, {}, kErrorInvalidRequest, ""},
      {"annotate with an election of text",
       kAnnotate,
       {{annotations, Value(Dictionary{{"election", Value("1")}})}},
       kErrorInvalidRequest,
       ""},
      {"annotate with nothing to change", kAnnotate, {{annotations, Value(Dictionary{})}}, 0, ""},
      {"annotate without UUIDs",
       kAnnotate,
       {{annotations, Value(elect)}},
       kErrorInvalidRequest,
       ""},
      {"annotate an unknown plug-in",
       kAnnotate,
       {{annotations, Value(elect)}, {uuids, Value(Array{Value(kUnknown)})}},
       kErrorInvalidRequest,
       ""},
      {"annotate a known plug-in",
       kAnnotate,
       {{annotations, Value(elect)}, {uuids, Value(Array{Value(kKnown)})}},
       0,
       ""},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    Reply reply = answer(c.type, c.body);
    EXPECT_EQ(reply.failed() ? reply.error->code : 0, c.code);
    if (c.member.empty()) {
      EXPECT_FALSE(reply.writeEncoded);
      continue;
    }
    // The member written straight in its encoding is one form: the plug-in's.
    ASSERT_EQ(reply.encodedKey, c.member);
    std::vector<uint8_t> encoded;
    reply.writeEncoded(encoded);
    Result<Value> form = cbor::decode(encoded);
    ASSERT_TRUE(form.ok() && form->dictionary());
    EXPECT_TRUE(form->dictionary()->contains("uuid"));
  }
  // The one annotation accepted is stored.
  std::optional<Dictionary> stored;
  server_->mainQueue()->sync([&] {
    stored = server_->database().annotationForPlugIn(*server_->database().findPlugIn(kKnown));
  });
  EXPECT_EQ(stored, elect);
}

}  // namespace
}  // namespace ek
