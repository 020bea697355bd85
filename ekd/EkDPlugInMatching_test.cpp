#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <unistd.h>

#include <asio/local/stream_protocol.hpp>
#include <cmath>
#include <filesystem>
#include <limits>
#include <mutex>
#include <random>
#include <string>
#include <vector>

#include "Ekora/EkProtocol.h"
#include "ekd/EkDPlugIn.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"
#include "platform/log/testing/CapturingSink.h"
#include "platform/types/TypeSystem.h"
#include "platform/vantor/FakeRegistry.h"

namespace ek {
namespace {

namespace fs = std::filesystem;

constexpr std::string_view kIdentifier = "com.example.host.viewer";
constexpr std::string_view kHostApp = "/Applications/Host.app";
constexpr std::string_view kSystemRoot = "/System";

class CapturingSink : public log::testing::CapturingSink {
 public:
  int countIn(std::string_view category) const {
    return countIf([&](const Line& line) { return line.category == category; });
  }
  std::string lastLine() const {
    std::vector<Line> all = lines();
    return all.empty() ? std::string() : all.back().message;
  }
};

// The attributes every test plug-in carries beside the ones a test adds.
Dictionary baseAttributes() {
  return Dictionary{
      {"ZuExtensionPointIdentifier", "com.corvane.share"},
      {"Kind", "viewer"},
      {"Flag", false},
      {"Enabled", true},
      {"Count", 5},
      {"Ratio", 1.5},
      {"Types", Array{"public.image", "public.movie"}},
      {"Mixed", Array{5, "b", true}},
      {"NoStrings", Array{5, Array{"a"}}},
      {"Rule", Dictionary{{"public.image", 2}}},
      {"ZuExtensionIdentifier", "com.example.pretender"},
      {"ZuExtensionContainingApp", "/Applications/Pretender.app"},
      {"ENTITLEMENT:com.example.attribute-only", "shadow"},
  };
}

class MatchingTest : public ::testing::Test {
 protected:
  void SetUp() override {
    log::configure("debug");
    log::setSink(sink_);
  }
  void TearDown() override {
    log::setSink(nullptr);
    log::configure("default");
  }

  EkDPlugInContext context() {
    EkDPlugInContext context;
    context.registry = registry_;
    context.systemRoot = std::string(kSystemRoot);
    context.types = types_;
    context.annotations = [this](const EkDPlugIn& plugIn) {
      askedFor_.push_back(plugIn.uuid());
      return annotation_;
    };
    return context;
  }

  // A plug-in inside Host.app unless inApp is false (then a system plug-in with none), with
  // extra attributes over baseAttributes() and extra keys in ZuExtension and at the top level.
  std::shared_ptr<EkDPlugIn> build(Dictionary extraAttributes = {}, Dictionary extension = {},
                                   Dictionary topLevel = {}, Dictionary entitlements = {},
                                   bool inApp = true) {
    return buildIn(context(), std::move(extraAttributes), std::move(extension), std::move(topLevel),
                   std::move(entitlements), inApp);
  }
  std::shared_ptr<EkDPlugIn> buildIn(EkDPlugInContext context, Dictionary extraAttributes,
                                     Dictionary extension, Dictionary topLevel,
                                     Dictionary entitlements, bool inApp) {
    vantor::PlugInProxy proxy;
    proxy.uuid = Uuid::random();
    proxy.identifier = std::string(kIdentifier);
    proxy.originalIdentifier = proxy.identifier;
    if (inApp) {
      proxy.path = std::string(kHostApp) + "/PlugIns/Viewer.appex";
      proxy.containingAppPath = std::string(kHostApp);
    } else {
      proxy.path = std::string(kSystemRoot) + "/Library/PlugIns/Viewer.bundle";
      proxy.onSystemVolume = true;
    }
    proxy.url = vantor::fileUrlForPath(proxy.path);
    proxy.dataContainerPath = "/var/lib/ekora/containers/" + proxy.identifier;
    proxy.entitlements = std::move(entitlements);
    Dictionary attributes = baseAttributes();
    for (auto& [key, value] : extraAttributes) attributes.insert_or_assign(key, value);
    extension.emplace("ZuExtensionPointIdentifier", "com.corvane.share");
    extension.emplace("ZuExtensionProtocol", "com.example.viewer-protocol");
    extension.insert_or_assign("ZuExtensionAttributes", attributes);
    topLevel.emplace("QvBundleIdentifier", proxy.identifier);
    topLevel.insert_or_assign("ZuExtension", extension);
    proxy.info = std::move(topLevel);
    proxy.extensionPoint = "com.corvane.share";
    registry_->install(proxy);
    auto record = EkDPlugIn::createWithVRData(proxy, std::move(context));
    EXPECT_NE(record, nullptr) << sink_->lastLine();
    return record;
  }

  std::shared_ptr<CapturingSink> sink_ = std::make_shared<CapturingSink>();
  std::shared_ptr<vantor::FakeRegistry> registry_ = std::make_shared<vantor::FakeRegistry>();
  std::shared_ptr<types::TypeSystem> types_ = std::make_shared<types::TypeSystem>();
  std::optional<Dictionary> annotation_;
  std::vector<Uuid> askedFor_;
};

// ---- One pattern: the operators --------------------------------------------------------------

struct OperatorCase {
  std::string value;
  std::string pattern;
  bool matches;
};

TEST_F(MatchingTest, OperatorsCompareWithNumericOrdering) {
  const std::string bigRun = "1" + std::string(10000, '0');
  const std::string nines(9999, '9');
  const OperatorCase cases[] = {
      // No operator: equality.
      {"abc", "abc", true},
      {"abc", "abd", false},
      {"abc", "ABC", false},
      {"", "", true},
      {"x", "", false},
      {"1.10", "1.10", true},
      {"1.1", "1.01", false},
      // "=".
      {"abc", "=abc", true},
      {"abc", "=ABC", false},
      {"1", "= 1", false},
      {" 1", "= 1", true},
      {"", "=", true},
      {"=abc", "=abc", false},
      {"01", "=1", false},
      // "<>".
      {"abd", "<>abc", true},
      {"abc", "<>abc", false},
      {"5", "<>5", false},  // read as "<" with operand ">5" it would match
      {"Abc", "<>abc", true},
      // "<=".
      {"5", "<=5", true},
      {"4", "<=5", true},
      {"6", "<=5", false},  // read as "<" with operand "=5" it would match
      {"10", "<=9", false},
      // ">=".
      {"1.10", ">=1.10", true},
      {"2", ">=1.10", true},
      {"1.9", ">=1.10", false},
      {"5", ">=5", true},  // read as ">" with operand "=5" it would not match
      // "<".
      {"4", "<5", true},
      {"5", "<5", false},
      {"10", "<5", false},
      {"9", "<10", true},
      {"Name7", "<Name25", true},
      {"Name25", "<Name7", false},
      {"1", "<1.0", true},
      {"01", "<1", true},  // equal values: the run with more leading zeros is the lower
      {"a", "<b", true},
      {"B", "<a", true},  // case-sensitive, upper case before lower case
      // ">".
      {"10", ">5", true},
      {"5", ">5", false},
      {"4", ">5", false},
      {"1.10", ">1.9", true},
      {"2.0", ">10.0", false},
      {"1", ">01", true},
      {"version 12 build 3", ">version 12 build 2", true},
      // Digit runs far longer than any machine integer.
      {bigRun, ">" + nines, true},
      {nines, "<" + bigRun, true},
      {bigRun, "=" + bigRun, true},
      {"0000" + bigRun, ">=" + bigRun, false},
  };
  auto plugIn = build();
  ASSERT_NE(plugIn, nullptr);
  for (const OperatorCase& c : cases) {
    EXPECT_EQ(plugIn->matchValue(c.value, std::string_view(c.pattern)), c.matches)
        << "value " << c.value.substr(0, 40) << " pattern " << c.pattern.substr(0, 40);
  }
}

TEST_F(MatchingTest, TypeTestsUseTheTypeSystem) {
  const OperatorCase cases[] = {
      {"public.jpeg", "?TY-CONFORMS:public.data", true},
      {"public.jpeg", "?TY-CONFORMS:public.jpeg", true},
      {"public.folder", "?TY-CONFORMS:public.data", false},
      {"public.image", "?TY-CONFORMS:public.jpeg", false},
      {"public.jpeg", "?TY-CONFORMS: public.data", false},
      {"com.example.unknown", "?TY-CONFORMS:public.item", false},
      {"public.image", "?TY-IS:public.jpeg", true},
      {"public.jpeg", "?TY-IS:public.jpeg", true},
      {"public.item", "?TY-IS:public.jpeg", true},
      {"public.png", "?TY-IS:public.jpeg", false},
      {"public.jpeg", "?TY-IS:public.image", false},
  };
  auto plugIn = build();
  ASSERT_NE(plugIn, nullptr);
  for (const OperatorCase& c : cases) {
    EXPECT_EQ(plugIn->matchValue(c.value, std::string_view(c.pattern)), c.matches)
        << c.value << " against " << c.pattern;
  }
  EXPECT_EQ(sink_->countIn("ops"), 0);
}

TEST_F(MatchingTest, UnknownQuestionOperatorIsLoggedAndNeverMatches) {
  auto plugIn = build();
  ASSERT_NE(plugIn, nullptr);
  for (std::string pattern : {"?", "?TY-conforms:public.data", "?EQ:abc", "?TY-ISpublic.jpeg"}) {
    sink_->clear();
    EXPECT_FALSE(plugIn->matchValue("public.jpeg", std::string_view(pattern))) << pattern;
    EXPECT_EQ(sink_->count(log::Level::Info, "ops", "unrecognized match operator:" + pattern), 1)
        << pattern;
  }
}

TEST_F(MatchingTest, TypeTestsUseTheContextTypeSystem) {
  char pattern[] = "/tmp/ekmatch-types-XXXXXX";
  ASSERT_NE(::mkdtemp(pattern), nullptr);
  const fs::path dir = pattern;
  ASSERT_TRUE(
      dmap::writeFileAtomically((dir / "raw.dmap").string(),
                                Value(Dictionary{{"com.example.raw", Array{"public.image"}}}))
          .ok());
  types_ = types::TypeSystem::loadFrom(dir.string());
  fs::remove_all(dir);
  auto plugIn = build();
  ASSERT_NE(plugIn, nullptr);
  EXPECT_TRUE(plugIn->matchValue("com.example.raw", std::string_view("?TY-CONFORMS:public.data")));
  EXPECT_TRUE(plugIn->matchValue("public.image", std::string_view("?TY-IS:com.example.raw")));
}

TEST_F(MatchingTest, PatternListTriesEachStringElement) {
  auto plugIn = build();
  ASSERT_NE(plugIn, nullptr);
  EXPECT_TRUE(plugIn->matchValue("b", Value(Array{"a", "b"})));
  EXPECT_FALSE(plugIn->matchValue("c", Value(Array{"a", "b"})));
  EXPECT_FALSE(plugIn->matchValue("b", Value(Array{})));
  EXPECT_FALSE(plugIn->matchValue("5", Value(Array{5})));
  EXPECT_TRUE(plugIn->matchValue("5", Value(Array{5, true, ">4"})));
  EXPECT_TRUE(plugIn->matchValue("b", Value("b")));
  EXPECT_FALSE(plugIn->matchValue("5", Value(5)));
  EXPECT_FALSE(plugIn->matchValue("true", Value(true)));
  EXPECT_FALSE(plugIn->matchValue("b", Value(Dictionary{{"b", "b"}})));
}

// ---- One rule: key resolution and pattern kinds ----------------------------------------------

struct KeyCase {
  const char* name;
  std::string key;
  Value pattern;
  bool matches;
};

TEST_F(MatchingTest, RulesOfAPlugInInsideAnApplication) {
  auto plugIn = build(
      Dictionary{}, Dictionary{{"HiddenKey", "hidden"}},
      Dictionary{{"TopKey", "top"}, {"Kind", "info-kind"}},
      Dictionary{
          {"com.example.flag", true}, {"com.example.off", false}, {"com.example.name", "alpha"}});
  ASSERT_NE(plugIn, nullptr);
  const std::string uuid = plugIn->uuid().string();
  std::string lowerUuid = uuid;
  for (char& c : lowerUuid) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  const KeyCase cases[] = {
      {"attribute equal", "Kind", "viewer", true},
      {"attribute differs", "Kind", "editor", false},
      {"attributes before the info dictionary", "Kind", "info-kind", false},
      {"info dictionary after the attributes", "TopKey", "top", true},
      {"not inside ZuExtension outside the attributes", "HiddenKey", "hidden", false},
      {"not inside ZuExtension, pattern true", "HiddenKey", true, false},
      {"true against a string", "Kind", true, true},
      {"true against true", "Enabled", true, true},
      {"true against false", "Flag", true, false},
      {"true against missing", "Missing", true, false},
      {"true against a number", "Count", true, true},
      {"false against missing", "Missing", false, true},
      {"false against false", "Flag", false, true},
      {"false against a string", "Kind", false, false},
      {"false against true", "Enabled", false, false},
      {"number against string pattern", "Count", "5", false},
      {"number pattern", "Count", 5, false},
      {"number pattern against string", "Kind", 1, false},
      {"double value", "Ratio", "1.5", false},
      {"string pattern against missing", "Missing", "viewer", false},
      {"array pattern against missing", "Missing", Array{"viewer"}, false},
      {"operator through a rule", "Kind", ">=viewer", true},
      {"array pattern holding the value", "Kind", Array{"a", "viewer"}, true},
      {"array pattern without it", "Kind", Array{"a", "b"}, false},
      {"empty array pattern", "Kind", Array{}, false},
      {"array pattern with non-strings", "Kind", Array{5, true, "viewer"}, true},
      {"array value holds the pattern", "Types", "public.movie", true},
      {"array value lacks the pattern", "Types", "public.text", false},
      {"array value, array pattern", "Types", Array{"x", "public.image"}, true},
      {"array value, array pattern without any", "Types", Array{"x", "y"}, false},
      {"array value, empty array pattern", "Types", Array{}, false},
      {"array value, conforms", "Types", "?TY-CONFORMS:public.audiovisual-content", true},
      {"array value, conforms to nothing", "Types", "?TY-CONFORMS:public.text", false},
      {"array value, is", "Types", "?TY-IS:public.jpeg", true},
      {"array value, is nothing", "Types", "?TY-IS:public.text", false},
      {"array value, not equal", "Types", "<>public.image", true},
      {"array value, greater", "Types", ">public.j", true},
      {"array value, less", "Types", "<public.a", false},
      {"array value, not greater", "Types", "<=public.image", true},
      {"array value, not less", "Types", ">=public.movie", true},
      {"array value, above all", "Types", ">=public.n", false},
      {"array elements that are not strings", "Mixed", "5", false},
      {"array string element among others", "Mixed", "b", true},
      {"array without strings", "NoStrings", "a", false},
      {"array without strings, not equal", "NoStrings", "<>a", false},
      {"dictionary value, string pattern", "Rule", "public.image", false},
      {"activation rule accepts", "Rule", Dictionary{{"public.jpeg", 2}}, true},
      {"activation rule over its limit", "Rule", Dictionary{{"public.jpeg", 3}}, false},
      {"activation rule, other type", "Rule", Dictionary{{"public.plain-text", 1}}, false},
      {"string value as activation rule", "Kind", Dictionary{{"public.jpeg", 1}}, false},
      {"activation rule against missing", "Missing", Dictionary{}, false},
      {"data pattern", "Kind", Data{1, 2}, false},
      {"identifier", "ZuExtensionIdentifier", std::string(kIdentifier), true},
      {"identifier before the attribute", "ZuExtensionIdentifier", "com.example.pretender", false},
      {"identifier with an operator", "ZuExtensionIdentifier", "<>com.example.other", true},
      {"uuid upper case", "com.corvane.uuid", uuid, true},
      {"uuid lower case", "com.corvane.uuid", lowerUuid, false},
      {"containing application", "ZuExtensionContainingApp", std::string(kHostApp), true},
      {"containing application before the attribute", "ZuExtensionContainingApp",
       "/Applications/Pretender.app", false},
      {"containing application, true", "ZuExtensionContainingApp", true, true},
      {"containing application, false", "ZuExtensionContainingApp", false, false},
      {"entitlement true", "ENTITLEMENT:com.example.flag", true, true},
      {"entitlement false", "ENTITLEMENT:com.example.off", true, false},
      {"entitlement absent", "ENTITLEMENT:com.example.absent", true, false},
      {"entitlement absent, pattern false", "ENTITLEMENT:com.example.absent", false, true},
      {"entitlement string", "ENTITLEMENT:com.example.name", "alpha", true},
      {"entitlement string differs", "ENTITLEMENT:com.example.name", "beta", false},
      {"entitlement keys look nowhere else", "ENTITLEMENT:com.example.attribute-only", "shadow",
       false},
      {"the whole key is an attribute name elsewhere", "ENTITLEMENT:", true, false},
  };
  for (const KeyCase& c : cases) {
    EXPECT_EQ(plugIn->matchKey(c.key, c.pattern), c.matches) << c.name;
  }
}

TEST_F(MatchingTest, ContainingAppRuleFailsAtOnceOutsideAnyApplication) {
  auto plugIn = build({}, {}, {}, {}, /*inApp=*/false);
  ASSERT_NE(plugIn, nullptr);
  // The attribute of the same name is never consulted.
  EXPECT_FALSE(plugIn->matchKey("ZuExtensionContainingApp", Value(false)));
  EXPECT_FALSE(plugIn->matchKey("ZuExtensionContainingApp", Value(true)));
  EXPECT_FALSE(plugIn->matchKey("ZuExtensionContainingApp", Value("/Applications/Pretender.app")));
  EXPECT_FALSE(plugIn->matchKey("ZuExtensionContainingApp", Value(Array{})));
  EXPECT_TRUE(plugIn->matchKey("Kind", Value("viewer")));
}

// ---- Elections -------------------------------------------------------------------------------

struct ElectionCase {
  const char* name;
  std::optional<Dictionary> annotation;
  std::string pattern;
  bool matches;
};

TEST_F(MatchingTest, ElectionComesFromTheAnnotationWithFlagBitsCleared) {
  const ElectionCase cases[] = {
      {"no annotation", std::nullopt, "0", true},
      {"no annotation is not 1", std::nullopt, "1", false},
      {"annotation without election", Dictionary{{"other", 3}}, "0", true},
      {"flag bits ignored", Dictionary{{"election", 0x101}}, "1", true},
      {"flag bits only", Dictionary{{"election", 0xFF00}}, "0", true},
      {"bits above 15 kept", Dictionary{{"election", 0x10101}}, "65537", true},
      {"elected 2", Dictionary{{"election", 2}}, ">=1", true},
      {"elected 2 is not 1", Dictionary{{"election", 2}}, "1", false},
      {"negative", Dictionary{{"election", -1}}, "-65281", true},
      {"double truncated", Dictionary{{"election", 1.9}}, "1", true},
      {"nan", Dictionary{{"election", std::nan("")}}, "0", true},
      {"huge double saturates", Dictionary{{"election", 1e300}}, "9223372036854710527", true},
      {"huge negative double saturates", Dictionary{{"election", -1e300}}, "-9223372036854775808",
       true},
      {"largest unsigned wraps", Dictionary{{"election", std::numeric_limits<uint64_t>::max()}},
       "-65281", true},
      {"boolean true is 1", Dictionary{{"election", true}}, "1", true},
      {"boolean false is 0", Dictionary{{"election", false}}, "0", true},
      {"string is not a number", Dictionary{{"election", "1"}}, "0", true},
  };
  auto plugIn = build();
  ASSERT_NE(plugIn, nullptr);
  for (const ElectionCase& c : cases) {
    annotation_ = c.annotation;
    askedFor_.clear();
    EXPECT_EQ(plugIn->matchKey("ZuUserElection", Value(c.pattern)), c.matches) << c.name;
    ASSERT_EQ(askedFor_.size(), 1u) << c.name;
    EXPECT_EQ(askedFor_.front(), plugIn->uuid());
  }
}

TEST_F(MatchingTest, ElectionWithoutAnnotationSourceIsZero) {
  EkDPlugInContext plain = context();
  plain.annotations = nullptr;
  auto plugIn = buildIn(plain, {}, {}, {}, {}, true);
  ASSERT_NE(plugIn, nullptr);
  EXPECT_TRUE(plugIn->matchKey("ZuUserElection", Value("0")));
  EXPECT_TRUE(plugIn->matchKey("ZuUserElection", Value(true)));
  EXPECT_FALSE(plugIn->matchKey("ZuUserElection", Value(false)));
}

// ---- Whole rules -----------------------------------------------------------------------------

TEST_F(MatchingTest, WholeRulesNeedEveryKey) {
  auto plugIn = build();
  ASSERT_NE(plugIn, nullptr);
  EXPECT_TRUE(plugIn->match(nullptr));
  const Dictionary empty;
  EXPECT_TRUE(plugIn->match(&empty));
  const Dictionary both{{"Kind", "viewer"}, {"ZuExtensionIdentifier", std::string(kIdentifier)}};
  EXPECT_TRUE(plugIn->match(&both));
  const Dictionary oneFails{{"Kind", "viewer"}, {"Missing", true}};
  EXPECT_FALSE(plugIn->match(&oneFails));
  const Dictionary firstFails{{"AAA", "x"}, {"Kind", "viewer"}};
  EXPECT_FALSE(plugIn->match(&firstFails));
}

TEST_F(MatchingTest, ActivationRuleEvaluationIsLogged) {
  auto plugIn = build();
  ASSERT_NE(plugIn, nullptr);
  const Dictionary items{{"public.jpeg", 1}};
  const Value rule = Dictionary{{"public.image", 2}};
  sink_->clear();
  EXPECT_TRUE(plugIn->matchDictionary(rule, items));
  EXPECT_EQ(sink_->count(log::Level::Debug, "extension",
                         "evaluating ZuExtension filter: " + Value(items).description() +
                             " value: " + rule.description()),
            1);
  EXPECT_FALSE(plugIn->matchDictionary(Value("public.image"), items));
  EXPECT_FALSE(plugIn->matchDictionary(Value(true), items));
}

// The summary used for array values must answer exactly what trying each element would.
TEST_F(MatchingTest, ArrayValueAnswersAsEachElementWould) {
  const std::vector<std::string> pieces = {"1", "01", "10", "9", "a", "A", ".", "b", ""};
  const std::vector<std::string> operators = {"", "=", "<>", "<", ">", "<=", ">="};
  std::mt19937 random(1234);
  auto pick = [&](const std::vector<std::string>& from) {
    return from[std::uniform_int_distribution<size_t>(0, from.size() - 1)(random)];
  };
  auto word = [&] {
    std::string text;
    int n = std::uniform_int_distribution<int>(0, 3)(random);
    for (int i = 0; i < n; ++i) text += pick(pieces);
    return text;
  };
  for (int trial = 0; trial < 40; ++trial) {
    Array elements;
    int n = std::uniform_int_distribution<int>(0, 5)(random);
    for (int i = 0; i < n; ++i) elements.emplace_back(word());
    auto plugIn = build(Dictionary{{"List", elements}});
    ASSERT_NE(plugIn, nullptr);
    for (int p = 0; p < 50; ++p) {
      const std::string pattern = pick(operators) + word();
      bool expected = false;
      for (const Value& element : elements) {
        expected = expected || plugIn->matchValue(*element.string(), std::string_view(pattern));
      }
      EXPECT_EQ(plugIn->matchKey("List", Value(pattern)), expected)
          << Value(elements).description() << " against " << pattern;
    }
  }
}

// ---- Large inputs ----------------------------------------------------------------------------

TEST_F(MatchingTest, LongValuesAndPatternsAnswer) {
  auto plugIn = build();
  ASSERT_NE(plugIn, nullptr);
  const std::string letters(100000, 'a');
  EXPECT_TRUE(plugIn->matchValue(letters, std::string_view("<" + std::string(99999, 'a') + "b")));
  EXPECT_TRUE(plugIn->matchValue(letters, std::string_view(letters)));
  const std::string digits = "1" + std::string(99999, '0');
  EXPECT_TRUE(plugIn->matchValue(digits, std::string_view(">" + std::string(99999, '9'))));
  EXPECT_FALSE(plugIn->matchValue(digits, std::string_view("<>" + digits)));
}

TEST_F(MatchingTest, LargeArrayPatternsAndValuesAnswer) {
  Array many;
  many.reserve(100000);
  for (int i = 0; i < 100000; ++i) many.emplace_back("item" + std::to_string(i));
  Array others;
  others.reserve(100000);
  for (int i = 0; i < 100000; ++i) others.emplace_back("other" + std::to_string(i));
  auto plugIn = build(Dictionary{{"Many", many}});
  ASSERT_NE(plugIn, nullptr);
  EXPECT_FALSE(plugIn->matchKey("Kind", Value(others)));
  Array withKind = others;
  withKind.emplace_back("viewer");
  EXPECT_TRUE(plugIn->matchKey("Kind", Value(withKind)));
  // An array value against an array pattern of the same size.
  EXPECT_FALSE(plugIn->matchKey("Many", Value(others)));
  withKind.emplace_back("item99999");
  EXPECT_TRUE(plugIn->matchKey("Many", Value(withKind)));
  EXPECT_TRUE(plugIn->matchKey("Many", Value(">=item99999")));
  EXPECT_FALSE(plugIn->matchKey("Many", Value(">item99999")));
}

// ---- Host permission -------------------------------------------------------------------------

class PermissionTest : public MatchingTest {
 protected:
  void SetUp() override {
    MatchingTest::SetUp();
    char pattern[] = "/tmp/ekmatch-server-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    dir_ = pattern;
    setenv("EKORA_RUNTIME_DIR", dir_.c_str(), 1);
    setenv("EKORA_STATE_DIR", dir_.c_str(), 1);
    EkDPlatform platform;
    platform.codeSigning = codeSigning_;
    platform.sandbox = std::make_shared<FakeSandboxCheck>();
    platform.registry = registry_;
    platform.serviceManager = std::make_shared<stard::FakeServiceManager>();
    platform.notifier = std::make_shared<notify::FakeNotifier>();
    platform.types = types_;
    server_ = EkDServer::initForService("match-unit-server", std::nullopt, platform);
    ASSERT_TRUE(server_);
  }
  void TearDown() override {
    for (int fd : peers_) close(fd);
    if (server_) server_->stop();
    std::error_code ignored;
    fs::remove_all(dir_, ignored);
    MatchingTest::TearDown();
  }

  // A client of this process holding entitlements.
  std::shared_ptr<EkDWyreClient> host(Dictionary entitlements) {
    codeSigning_->setEntitlements(getpid(), std::move(entitlements));
    int fds[2];
    EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
    peers_.push_back(fds[1]);
    asio::local::stream_protocol::socket socket(wyre::ioContext());
    socket.assign(asio::local::stream_protocol(), fds[0]);
    auto token = AuditToken::forSocket(fds[0]);
    EXPECT_TRUE(token);
    return EkDWyreClient::initWithConnection(
        wyre::Connection::adopt(std::move(socket), std::move(*token)), server_);
  }

  std::string dir_;
  std::shared_ptr<FakeCodeSigning> codeSigning_ = std::make_shared<FakeCodeSigning>();
  std::shared_ptr<EkDServer> server_;
  std::vector<int> peers_;
};

struct PermissionCase {
  const char* name;
  Dictionary hostEntitlements;
  std::optional<Value> requirement;  // the plug-in's ZuExtensionHostEntitlement
  std::optional<std::string> refusal;
};

TEST_F(PermissionTest, AllowForClientReasons) {
  const std::string restriction(protocol::kEntitlementAllowedPlugIns);
  const std::string notAllowed = "the host's plug-in entitlement does not allow this plug-in";
  const std::string invalid = "invalid host restriction entitlement";
  const std::string missingNeeded = "the host does not have the \"com.example.needed\" entitlement";
  const PermissionCase cases[] = {
      {"nothing asked either way", {}, std::nullopt, std::nullopt},
      {"restriction that is an array",
       {{restriction, Array{std::string(kIdentifier)}}},
       std::nullopt,
       invalid},
      {"restriction that is a string",
       {{restriction, std::string(kIdentifier)}},
       std::nullopt,
       invalid},
      {"restriction that is true", {{restriction, true}}, std::nullopt, invalid},
      {"restriction naming this plug-in",
       {{restriction, Dictionary{{"ZuExtensionIdentifier", std::string(kIdentifier)}}}},
       std::nullopt,
       std::nullopt},
      {"restriction naming another plug-in",
       {{restriction, Dictionary{{"ZuExtensionIdentifier", "com.example.other"}}}},
       std::nullopt,
       notAllowed},
      {"restriction on an attribute",
       {{restriction, Dictionary{{"Kind", "viewer"}}}},
       std::nullopt,
       std::nullopt},
      {"empty restriction", {{restriction, Dictionary{}}}, std::nullopt, std::nullopt},
      {"required entitlement held",
       {{"com.example.needed", true}},
       Value("com.example.needed"),
       std::nullopt},
      {"required entitlement held as a string",
       {{"com.example.needed", "yes"}},
       Value("com.example.needed"),
       std::nullopt},
      {"required entitlement false",
       {{"com.example.needed", false}},
       Value("com.example.needed"),
       missingNeeded},
      {"required entitlement missing", {}, Value("com.example.needed"), missingNeeded},
      {"both fail: the restriction speaks",
       {{restriction, Dictionary{{"ZuExtensionIdentifier", "com.example.other"}}},
        {"com.example.needed", false}},
       Value("com.example.needed"),
       notAllowed},
      {"restriction passes, requirement fails",
       {{restriction, Dictionary{{"Kind", "viewer"}}}},
       Value("com.example.needed"),
       missingNeeded},
      {"requirement that is not a string",
       {{"5", true}},
       Value(5),
       "the host does not have the \"" + Value(5).description() + "\" entitlement"},
      {"requirement that is an array",
       {{"com.example.needed", true}},
       Value(Array{"com.example.needed"}),
       "the host does not have the \"" + Value(Array{"com.example.needed"}).description() +
           "\" entitlement"},
  };
  for (const PermissionCase& c : cases) {
    Dictionary extension;
    if (c.requirement) extension.emplace("ZuExtensionHostEntitlement", *c.requirement);
    auto plugIn = build({}, extension);
    ASSERT_NE(plugIn, nullptr) << c.name;
    auto client = host(c.hostEntitlements);
    ASSERT_NE(client, nullptr) << c.name;
    EXPECT_EQ(plugIn->allowForClient(*client->process()), c.refusal) << c.name;
  }
}

}  // namespace
}  // namespace ek
