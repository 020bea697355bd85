#include "ekd/EkDPlugIn.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <limits>
#include <string>
#include <vector>

#include "Ekora/EkProtocol.h"
#include "Ekora/EkSandboxKey.h"
#include "ekd/EkDFormCache.h"
#include "ekd/EkDWyreClient.h"
#include "platform/cbor/Cbor.h"
#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"
#include "platform/log/testing/CapturingSink.h"
#include "platform/privo/Consent.h"
#include "platform/stard/ServiceManager.h"
#include "platform/testing/Files.h"
#include "platform/types/TypeSystem.h"
#include "platform/vantor/FakeRegistry.h"

namespace ek {
namespace {

namespace fs = std::filesystem;

constexpr std::string_view kHostIdentifier = "com.example.host";
constexpr std::string_view kIdentifier = "com.example.plugin";
const std::string kKeyboardNetwork = "com.corvane.privo.keyboard-network";

// What a plug-in bundle declares.
struct Spec {
  std::string identifier = std::string(kIdentifier);
  std::optional<std::string> point = "com.corvane.share";
  Dictionary attributes;
  Dictionary extension;  // beside the point, the protocol and the attributes
  Dictionary info;       // top-level keys beside the identifier and ZuExtension
  Dictionary entitlements;
  bool inApp = true;
  bool dataOnly = false;
};

// Plug-in records over a fake registry, in a temporary tree holding Host.app (whose plug-ins
// live in its PlugIns folder) and a system volume.
class PlugInTest : public ::testing::Test {
 protected:
  void SetUp() override {
    log::configure("info");
    log::setSink(sink_);
    ASSERT_TRUE(testing::writeFile(
        app() + "/Info.dmap",
        dmap::write(Value(Dictionary{{"QvBundleIdentifier", kHostIdentifier}})).value()));
  }
  void TearDown() override {
    log::setSink(nullptr);
    log::configure("default");
  }

  std::string app() const { return dir_.file("Applications/Host.app"); }
  std::string systemRoot() const { return dir_.file("System"); }
  std::string bundleOf(const Spec& spec) const {
    return spec.inApp ? app() + "/PlugIns/" + spec.identifier + ".appex"
                      : systemRoot() + "/Library/PlugIns/" + spec.identifier + ".bundle";
  }

  vantor::PlugInProxy proxy(const Spec& spec = {}) const {
    vantor::PlugInProxy proxy;
    proxy.uuid = Uuid::random();
    proxy.identifier = proxy.originalIdentifier = spec.identifier;
    proxy.path = bundleOf(spec);
    proxy.url = vantor::fileUrlForPath(proxy.path);
    if (spec.inApp) proxy.containingAppPath = app();
    proxy.onSystemVolume = !spec.inApp;
    if (!spec.dataOnly) proxy.dataContainerPath = dir_.file("containers/" + spec.identifier);
    proxy.entitlements = spec.entitlements;
    proxy.registrationDate = Date{1700000000.75};
    Dictionary attributes = spec.attributes;
    attributes.emplace("ZuExtensionVersion", "3.1");
    Dictionary extension = spec.extension;
    if (spec.point) extension.emplace("ZuExtensionPointIdentifier", *spec.point);
    extension.emplace("ZuExtensionProtocol", spec.dataOnly ? "#Data" : "com.example.Service");
    extension.emplace("ZuExtensionAttributes", attributes);
    proxy.info = spec.info;
    proxy.info.emplace("QvBundleIdentifier", spec.identifier);
    proxy.info.emplace("QvBundleVersion", "3");
    proxy.info.insert_or_assign("ZuExtension", extension);
    proxy.extensionPoint = spec.point;
    fs::create_directories(proxy.path + "/Resources");
    testing::writeFile(proxy.path + "/Info.dmap", dmap::write(Value(proxy.info)).value());
    return proxy;
  }
  EkDPlugInContext context() {
    EkDPlugInContext context;
    context.registry = registry_;
    context.sandbox = sandbox_;
    context.systemRoot = systemRoot();
    context.annotations = [this](const EkDPlugIn&) { return annotation_; };
    context.types = std::make_shared<types::TypeSystem>();
    context.serviceManager = serviceManager_;
    context.consent = consent_;
    return context;
  }
  std::shared_ptr<EkDPlugIn> record(const vantor::PlugInProxy& proxy) {
    registry_->install(proxy);
    return EkDPlugIn::createWithVRData(proxy, context());
  }
  std::shared_ptr<EkDPlugIn> build(const Spec& spec = {}) {
    auto made = record(proxy(spec));
    EXPECT_NE(made, nullptr);
    return made;
  }
  // Enables the plug-in for this process; answers the overlay declared, or nothing.
  std::optional<Dictionary> enable(const EkDPlugIn& record, const Dictionary* environment) {
    const size_t before = serviceManager_->declarations().size();
    EXPECT_EQ(record.enableForClient(*host_, environment), std::nullopt);
    auto declarations = serviceManager_->declarations();
    if (declarations.size() != before + 1) return std::nullopt;
    return declarations.back().overlay;
  }
  std::optional<EkSandboxGrant> consume(const Value* token) {
    int64_t handle = token && token->string() ? sandbox_->consume(*token->string()) : -1;
    if (handle < 0) return std::nullopt;
    return sandbox_->grant(handle);
  }

  testing::TempDir dir_;
  std::shared_ptr<log::testing::CapturingSink> sink_ =
      std::make_shared<log::testing::CapturingSink>();
  std::shared_ptr<vantor::FakeRegistry> registry_ = std::make_shared<vantor::FakeRegistry>();
  std::shared_ptr<EkSandbox> sandbox_ =
      std::make_shared<EkSandbox>(EkSandboxMemoryKeySource::random());
  std::shared_ptr<stard::FakeServiceManager> serviceManager_ =
      std::make_shared<stard::FakeServiceManager>();
  std::shared_ptr<privo::FakeConsent> consent_ = std::make_shared<privo::FakeConsent>();
  std::shared_ptr<FakeCodeSigning> codeSigning_ = std::make_shared<FakeCodeSigning>();
  std::shared_ptr<const EkDClientProcess> host_ =
      EkDClientProcess::read(AuditToken::self(), executableIdForPid(getpid()), *codeSigning_,
                             std::make_shared<FakeSandboxCheck>());
  std::optional<Dictionary> annotation_;
};

using EkDPlugInTest = PlugInTest;
using MatchingTest = PlugInTest;
using EnablingTest = PlugInTest;

// ---- The record ------------------------------------------------------------------------------

TEST_F(EkDPlugInTest, BuildsTheRecordFromRegistryFacts) {
  vantor::PlugInProxy extension = proxy({.entitlements = {{"yes", true}, {"no", false}, {"n", 0}}});
  auto record = this->record(extension);
  ASSERT_NE(record, nullptr);
  EXPECT_EQ(record->containingPath(), app());
  EXPECT_EQ(record->lastModified(), 1700000000);
  EXPECT_EQ(record->dataContainerURL()->path(), *extension.dataContainerPath);
  EXPECT_TRUE(record->isAppExtension());
  EXPECT_EQ(record->versionString(), "3.1");
  EXPECT_TRUE(record->hasEntitlement("yes") && record->hasEntitlement("n"));
  EXPECT_FALSE(record->hasEntitlement("no") || record->hasEntitlement("absent"));

  auto system = build({.inApp = false, .dataOnly = true});
  ASSERT_NE(system, nullptr);
  EXPECT_FALSE(system->containingUrl() || system->isAppExtension() || system->dataContainerURL());
  EXPECT_TRUE(system->onSystemVolume() && system->isData());

  extension.registrationDate = Date{1e12};
  EXPECT_EQ(this->record(extension)->lastModified(), std::numeric_limits<int32_t>::max());
  extension.identifier.clear();
  EXPECT_EQ(this->record(extension), nullptr);
}

TEST_F(EkDPlugInTest, RefusesMisconfiguredPlugInsWithTheirReasonLogged) {
  struct Case {
    const char* name;
    Spec spec;
    std::function<void(vantor::PlugInProxy&)> change;
    std::string reason;
  };
  const std::string outside = "plug-ins outside containing apps must be in /System";
  auto movedTo = [](std::string path) {
    return [path](vantor::PlugInProxy& p) { p.url = vantor::fileUrlForPath(p.path = path); };
  };
  const Case cases[] = {
      {"plug-in with code but no data container",
       {},
       [](vantor::PlugInProxy& p) { p.dataContainerPath.reset(); },
       "this plug-in has no sandbox data container"},
      {"outside any application and the system volume",
       {.inApp = false},
       movedTo(dir_.file("var/X.bundle")),
       outside},
      {"application extension naming a principal class",
       {.extension = {{"PrincipalClass", "MyPrincipal"}}},
       nullptr,
       "Application Extensions may not use the \"PrincipalClass\" key"},
      {"pass-proxy key",
       {.extension = {{"PassProxy", true}}},
       nullptr,
       "the \"PassProxy\" key is not supported on this platform"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    vantor::PlugInProxy made = proxy(c.spec);
    if (c.change) c.change(made);
    EXPECT_EQ(record(made), nullptr);
    EXPECT_TRUE(sink_->has(log::Level::Info, "ops",
                           "ignoring mis-configured plug-in at " + made.path + ": " + c.reason));
  }
}

TEST_F(EkDPlugInTest, InfoDictionaryFollowsTheRegistryAndEachFetchStaysAsItWas) {
  vantor::PlugInProxy made = proxy({.attributes = {{"Size", 16}}});
  auto record = this->record(made);
  ASSERT_NE(record, nullptr);
  EkDPlugIn::CurrentInfoRef before = record->currentInfo();
  EXPECT_FALSE(before->dedicated);

  Dictionary& extension = *made.info.at("ZuExtension").dictionary();
  extension["Dedicated"] = 1;
  (*extension["ZuExtensionAttributes"].dictionary())["Size"] = 64;
  registry_->install(made);
  EXPECT_EQ(*record->attribute("Size"), Value(64));
  EXPECT_TRUE(record->isDedicated());
  EXPECT_FALSE(before->dedicated);
  EXPECT_EQ(before->info->at("ZuExtension").getDictionary("ZuExtensionAttributes")->at("Size"),
            Value(16));

  // Gone by UUID: found again by its URL; gone altogether: empty until the registry changes.
  ASSERT_TRUE(registry_->uninstall(made.uuid));
  vantor::PlugInProxy moved = made;
  moved.uuid = Uuid::random();
  registry_->install(moved);
  ASSERT_NE(record->bundleInfoDictionary(), nullptr);
  ASSERT_TRUE(registry_->uninstall(moved.uuid));
  EXPECT_EQ(record->bundleInfoDictionary(), nullptr);
  EXPECT_TRUE(sink_->has(log::Level::Error, "ops",
                         "could not obtain fresh proxy for " + made.uuid.string()));
  registry_->install(made);
  EXPECT_NE(record->bundleInfoDictionary(), nullptr);
}

// ---- Forms and extensions --------------------------------------------------------------------

TEST_F(EkDPlugInTest, FormGrantsTheBundleOrItsSharedPathsAndAServiceExtensionToCode) {
  struct Case {
    const char* name;
    Spec spec;
    std::vector<std::string> granted;  // the keys of "extensions", "." the bundle itself
    bool service;
  };
  const Case cases[] = {
      {"application extension: its bundle whatever Shared says",
       {.extension = {{"Shared", Array{"Resources"}}}},
       {"."},
       true},
      {"system plug-in: its shared paths",
       {.extension = {{"Shared", "Resources"}}, .inApp = false},
       {"Resources"},
       true},
      {"system plug-in sharing nothing", {.inApp = false}, {}, true},
      {"data only: no service extension",
       {.extension = {{"Shared", Array{"Resources"}}}, .inApp = false, .dataOnly = true},
       {"Resources"},
       false},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    auto record = build(c.spec);
    ASSERT_NE(record, nullptr);
    Dictionary form;
    record->augmentForm(form);
    std::vector<std::string> granted;
    const Dictionary* extensions =
        form.contains("extensions") ? form.at("extensions").dictionary() : nullptr;
    for (const auto& [key, token] : extensions ? *extensions : Dictionary{}) {
      std::optional<EkSandboxGrant> grant = consume(&token);
      ASSERT_TRUE(grant);
      EXPECT_EQ(grant->subject, key == "." ? *record->path() : *record->path() + "/" + key);
      granted.push_back(key);
    }
    EXPECT_EQ(granted, c.granted);
    std::optional<EkSandboxGrant> service =
        consume(form.contains("service-extension") ? &form.at("service-extension") : nullptr);
    EXPECT_EQ(service.has_value(), c.service);
    EXPECT_EQ(service ? service->subject : c.spec.identifier, c.spec.identifier);
  }
}

TEST_F(EkDPlugInTest, ResourceExtensionsAreIssuedForStringsInsideTheBundleOnly) {
  auto record = build({.inApp = false});
  ASSERT_NE(record, nullptr);
  fs::create_directories(dir_.file("outside"));
  fs::create_directory_symlink(dir_.file("outside"), *record->path() + "/LinkOut");
  std::optional<Dictionary> extensions = record->issueResourceExtensions(
      Value(Array{".", "Resources/../Resources", 7, "Missing", "../../../outside", "LinkOut"}));
  ASSERT_TRUE(extensions);
  std::vector<std::string> keys;
  for (const auto& [key, token] : *extensions) keys.push_back(key);
  EXPECT_EQ(keys, (std::vector<std::string>{".", "Resources/../Resources"}));
  EXPECT_TRUE(sink_->has(log::Level::Info, "ops",
                         "failed to make extension for " + *record->path() + "/LinkOut" +
                             " in plug-in at " + *record->path() + ": Operation not permitted"));
  EXPECT_FALSE(record->issueResourceExtensions(Value(3)));
  EXPECT_EQ(record->issueResourceExtensions(Value(Array{})), Dictionary{});
}

TEST_F(EkDPlugInTest, KeptFormsFollowTheRegistryAndDropTheLeastRecentlyUsed) {
  auto decode = [](const EkDFormCache::EncodedForm& form) {
    std::vector<uint8_t> bytes;
    cbor::encodeMapHead(form.count, bytes);
    bytes.insert(bytes.end(), form.members.begin(), form.members.end());
    return cbor::decode(bytes).value();
  };
  vantor::PlugInProxy made = proxy();
  auto records = std::vector{record(made), build({.identifier = "b"}), build({.identifier = "c"})};
  records[0]->setAnnotations(std::make_shared<const Dictionary>(Dictionary{{"election", 1}}));
  EkDFormCache cache(1 << 20);
  auto kept = cache.formFor(records[0]);
  Dictionary expected = records[0]->exportForm().form;
  expected.erase("annotations");  // each reply adds its own
  EXPECT_EQ(decode(*kept), Value(expected));
  EXPECT_EQ(cache.formFor(records[0]), kept);

  made.info["QvBundleVersion"] = "9.9";
  registry_->install(made);
  auto changed = cache.formFor(records[0]);
  ASSERT_NE(changed, kept);
  EXPECT_EQ(*decode(*changed).getDictionary("bundleInfo")->at("QvBundleVersion").string(), "9.9");

  const size_t size = changed->members.capacity();
  EkDFormCache small(2 * size + size / 2);
  auto form0 = small.formFor(records[0]);
  auto form1 = small.formFor(records[1]);
  EXPECT_EQ(small.formFor(records[0]), form0);  // 0 is now the most recently used
  small.formFor(records[2]);                    // drops 1, not 0
  EXPECT_EQ(small.formFor(records[0]), form0);
  EXPECT_NE(small.formFor(records[1]), form1);
}

// ---- Matching --------------------------------------------------------------------------------

TEST_F(MatchingTest, OperatorsCompareWithNumericOrderingAndTypeTestsUseTheTypeSystem) {
  struct Case {
    std::string value;
    std::string pattern;
    bool matches;
  };
  const std::string bigRun = "1" + std::string(10000, '0');
  const Case cases[] = {
      {" 1", "= 1", true},
      {"01", "=1", false},
      {"5", "<>5", false},
      {"5", "<=5", true},
      {"6", "<=5", false},
      {"5", ">=5", true},
      {"1.9", ">=1.10", false},
      {"Name7", "<Name25", true},
      {"01", "<1", true},
      {"B", "<a", true},
      {"1.10", ">1.9", true},
      {bigRun, ">" + std::string(9999, '9'), true},
      {"0000" + bigRun, ">=" + bigRun, false},
      {"public.jpeg", "?TY-CONFORMS:public.data", true},
      {"public.item", "?TY-IS:public.jpeg", true},
      {"public.jpeg", "?TY-IS:public.image", false},
      {"public.jpeg", "?TY-conforms:public.data", false},  // unknown operators never match
  };
  auto plugIn = build();
  ASSERT_NE(plugIn, nullptr);
  for (const Case& c : cases) {
    EXPECT_EQ(plugIn->matchValue(c.value, std::string_view(c.pattern)), c.matches)
        << "value " << c.value.substr(0, 40) << " pattern " << c.pattern.substr(0, 40);
  }
}

TEST_F(MatchingTest, RulesOfAPlugInInsideAnApplication) {
  struct Case {
    const char* name;
    std::string key;
    Value pattern;
    bool matches;
  };
  auto plugIn = build({.attributes = {{"Kind", "viewer"},
                                      {"Types", Array{"public.image", "public.movie"}},
                                      {"Mixed", Array{5, "b", true}},
                                      {"Rule", Dictionary{{"public.image", 2}}},
                                      {"ZuExtensionIdentifier", "com.example.pretender"},
                                      {"ZuExtensionContainingApp", "/Pretender.app"},
                                      {"ENTITLEMENT:com.example.name", "shadow"}},
                       .extension = {{"HiddenKey", "hidden"}},
                       .info = {{"TopKey", "top"}, {"Kind", "info-kind"}},
                       .entitlements = {{"com.example.off", false}, {"com.example.name", "a"}}});
  ASSERT_NE(plugIn, nullptr);
  const Case cases[] = {
      {"attributes before the info dictionary", "Kind", "viewer", true},
      {"info dictionary after the attributes", "TopKey", "top", true},
      {"not inside ZuExtension outside the attributes", "HiddenKey", "hidden", false},
      {"true against a string", "Kind", true, true},
      {"false against a string", "Kind", false, false},
      {"operator through a rule", "Kind", ">=viewer", true},
      {"array pattern holding the value", "Kind", Array{5, "a", "viewer"}, true},
      {"array value, conforms", "Types", "?TY-CONFORMS:public.audiovisual-content", true},
      {"array value, not equal to one of two", "Types", "<>public.image", true},
      {"array value, not greater than the least", "Types", "<=public.image", true},
      {"array value, less than the greatest only", "Types", "<public.m", true},
      {"array value, not less than the greatest", "Types", ">=public.movie", true},
      {"array value, above all", "Types", ">public.movie", false},
      {"array string element among others", "Mixed", "b", true},
      {"activation rule accepts", "Rule", Dictionary{{"public.jpeg", 2}}, true},
      {"identifier before the attribute", "ZuExtensionIdentifier", std::string(kIdentifier), true},
      {"uuid", "com.corvane.uuid", plugIn->uuid().string(), true},
      {"containing application before the attribute", "ZuExtensionContainingApp", app(), true},
      {"entitlement false", "ENTITLEMENT:com.example.off", true, false},
      {"entitlement absent, pattern false", "ENTITLEMENT:com.example.absent", false, true},
      {"entitlement keys look nowhere else", "ENTITLEMENT:com.example.name", "a", true},
  };
  for (const Case& c : cases) EXPECT_EQ(plugIn->matchKey(c.key, c.pattern), c.matches) << c.name;
  const Dictionary both{{"Kind", "viewer"}, {"TopKey", "top"}};
  const Dictionary oneFails{{"AAA", "x"}, {"Kind", "viewer"}};
  EXPECT_TRUE(plugIn->match(nullptr) && plugIn->match(&both));
  EXPECT_FALSE(plugIn->match(&oneFails));
  // Outside any application the rule fails at once; the attribute is never consulted.
  auto system = build({.attributes = {{"ZuExtensionContainingApp", "/P.app"}}, .inApp = false});
  EXPECT_FALSE(system->matchKey("ZuExtensionContainingApp", Value(false)));
  EXPECT_FALSE(system->matchKey("ZuExtensionContainingApp", Value("/P.app")));
}

TEST_F(MatchingTest, ElectionComesFromTheAnnotationWithFlagBitsCleared) {
  struct Case {
    std::optional<Dictionary> annotation;
    std::string pattern;
  };
  const Case cases[] = {
      {std::nullopt, "0"},
      {Dictionary{{"election", 0x101}}, "1"},
      {Dictionary{{"election", -1}}, "-65281"},
      {Dictionary{{"election", true}}, "1"},
      {Dictionary{{"election", "1"}}, "0"},
  };
  auto plugIn = build();
  ASSERT_NE(plugIn, nullptr);
  for (const Case& c : cases) {
    annotation_ = c.annotation;
    const std::string text = annotation_ ? Value(*annotation_).description() : "none";
    EXPECT_TRUE(plugIn->matchKey("ZuUserElection", Value(c.pattern))) << text;
    EXPECT_FALSE(plugIn->matchKey("ZuUserElection", Value("<>" + c.pattern))) << text;
  }
}

TEST_F(MatchingTest, HostPermissionFollowsItsRestrictionAndThePlugInsRequirement) {
  struct Case {
    const char* name;
    Dictionary host;
    std::optional<Value> requirement;  // the plug-in's ZuExtensionHostEntitlement
    std::optional<std::string> refusal;
  };
  const std::string restriction(protocol::kEntitlementAllowedPlugIns);
  const std::string notAllowed = "the host's plug-in entitlement does not allow this plug-in";
  const std::string missing = "the host does not have the \"com.example.needed\" entitlement";
  const Value needed("com.example.needed");
  const Case cases[] = {
      {"nothing asked either way", {}, std::nullopt, std::nullopt},
      {"restriction that is not a dictionary",
       {{restriction, Array{}}},
       std::nullopt,
       "invalid host restriction entitlement"},
      {"restriction naming another",
       {{restriction, Dictionary{{"ZuExtensionIdentifier", "x"}}}},
       std::nullopt,
       notAllowed},
      {"required entitlement held as a string",
       {{"com.example.needed", "yes"}},
       needed,
       std::nullopt},
      {"restriction passes, requirement missing",
       {{restriction, Dictionary{{"ZuExtensionVersion", "3.1"}}}},
       needed,
       missing},
  };
  for (const Case& c : cases) {
    Dictionary extension;
    if (c.requirement) extension.emplace("ZuExtensionHostEntitlement", *c.requirement);
    auto plugIn = build({.extension = extension});
    ASSERT_NE(plugIn, nullptr) << c.name;
    codeSigning_->setEntitlements(getpid(), c.host);
    auto host = EkDClientProcess::read(AuditToken::self(), executableIdForPid(getpid()),
                                       *codeSigning_, std::make_shared<FakeSandboxCheck>());
    EXPECT_EQ(plugIn->allowForClient(*host), c.refusal) << c.name;
  }
}

// ---- Enabling --------------------------------------------------------------------------------

Dictionary serviceOf(const Dictionary& overlay) {
  auto it = overlay.find("WyreService");
  return it != overlay.end() && it->second.dictionary() ? *it->second.dictionary() : Dictionary{};
}

TEST_F(EnablingTest, ProfileFollowsThePointAndKeyboardsLeaveTheirsOnlyWithConsent) {
  struct Row {
    std::optional<std::string> point;
    std::optional<Value> requestsOpenAccess;
    bool networkGranted;
    std::string profile;
    bool consentAsked;
  };
  const std::string keyboard = "com.corvane.keyboard-service";
  const Row rows[] = {
      {keyboard, Value(true), true, "plugin", true},
      {keyboard, Value(true), false, "keyboard", true},
      {keyboard, Value(false), true, "keyboard", false},
      {keyboard, std::nullopt, true, "keyboard", false},
      {keyboard, Value("true"), true, "keyboard", false},
      {"com.corvane.netguard.filter-data", std::nullopt, false, "network-filter", false},
      {"com.corvane.app.non-ui-extension.multiple-instances", std::nullopt, false,
       "sandpit-devtools", false},
      {"com.corvane.peekview", std::nullopt, false, "plugin", false},
      {std::nullopt, std::nullopt, false, "plugin", false},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.point.value_or("no point"));
    consent_ = std::make_shared<privo::FakeConsent>();
    if (row.networkGranted) consent_->grant(std::string(kHostIdentifier), kKeyboardNetwork);
    consent_->grant(std::string(kHostIdentifier), "com.corvane.privo.camera");
    Spec spec{.point = row.point};
    if (row.requestsOpenAccess)
      spec.attributes.emplace("RequestsOpenAccess", *row.requestsOpenAccess);
    std::optional<Dictionary> overlay = enable(*build(spec), nullptr);
    ASSERT_TRUE(overlay);
    EXPECT_EQ(serviceOf(*overlay)["_SandboxProfile"], Value(row.profile));
    EXPECT_EQ(!consent_->queries().empty(), row.consentAsked);
  }
}

TEST_F(EnablingTest, PrivoServicesAreThoseOfAReadableContainingApplication) {
  consent_->grant(std::string(kHostIdentifier), kKeyboardNetwork);
  consent_->grant("com.example.elsewhere", "com.corvane.privo.camera");
  EXPECT_EQ(build()->allowedPrivoServices(), std::vector<std::string>{kKeyboardNetwork});
  EXPECT_EQ(consent_->queries(), std::vector<std::string>{std::string(kHostIdentifier)});
  EXPECT_TRUE(build({.inApp = false})->allowedPrivoServices().empty());
  consent_->setUnavailable(true);
  EXPECT_TRUE(build()->allowedPrivoServices().empty());
  consent_->setUnavailable(false);
  fs::remove(app() + "/Info.dmap");
  EXPECT_TRUE(build()->allowedPrivoServices().empty());
}

TEST_F(EnablingTest, OverlayDeclaresTheExecutableForTheHost) {
  auto record = build({.info = {{"QvBundleExecutable", "Thing"},
                                {"WyreService", Dictionary{{"Custom", 5},
                                                           {"_SandboxProfile", "unconfined"},
                                                           {"_OmitSandboxParameters", false}}}}});
  std::optional<Dictionary> overlay = enable(*record, nullptr);
  ASSERT_TRUE(overlay);
  const auto declaration = serviceManager_->declarations().back();
  EXPECT_EQ(declaration.hostPid, getpid());
  EXPECT_EQ(declaration.hostPath, host_->path());
  EXPECT_EQ(declaration.bundleIdentifier, kIdentifier);
  EXPECT_EQ(declaration.program, *record->path() + "/Thing");
  EXPECT_EQ(overlay->size(), 2u);
  EXPECT_EQ(overlay->at("QvBundlePackageType"), Value("WYR!"));
  Dictionary service = serviceOf(*overlay);
  EXPECT_EQ(service.size(), 4u);
  EXPECT_EQ(service.at("Custom"), Value(5));
  EXPECT_EQ(service.at("_SandboxProfile"), Value("plugin"));
  EXPECT_EQ(service.at("_OmitSandboxParameters"), Value(true));
}

TEST_F(EnablingTest, EnvironmentLayersContainerHostAndPlugInVariables) {
  struct Row {
    const char* name;
    std::optional<Value> plugInVariables;
    Dictionary host;
    Dictionary expected;  // beside HOME, QVFIXED_USER_HOME and TMPDIR of the container
  };
  const std::string home = dir_.file("containers/" + std::string(kIdentifier));
  const Dictionary fromContainer{
      {"HOME", home}, {"QVFIXED_USER_HOME", home}, {"TMPDIR", home + "/tmp"}};
  const Row rows[] = {
      {"host cannot replace the container's",
       std::nullopt,
       {{"HOME", "/home/host"}, {"TMPDIR", "/x"}, {"LANG", "de"}},
       {{"LANG", "de"}}},
      {"the plug-in's strings win",
       Value(Dictionary{{"HOME", "/plugin"}, {"LANG", "pl"}, {"N", 3}}),
       {{"LANG", "de"}, {"N", "host"}},
       {{"HOME", "/plugin"}, {"LANG", "pl"}, {"N", "host"}}},
      {"host values that are not carriable strings",
       std::nullopt,
       {{"NUMBER", 7},
        {"A=B", "equals in the name"},
        {"CONTROL", std::string("a\x01z")},
        {"NUL", std::string("a\0z", 3)},
        {"BADUTF8", std::string("\xff\xfe")},
        {"KEPT", "<&>\"' \t\nline"}},
       {{"KEPT", "<&>\"' \t\nline"}}},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.name);
    Spec spec;
    if (row.plugInVariables) {
      spec.info.emplace("WyreService", Dictionary{{"EnvironmentVariables", *row.plugInVariables}});
    }
    std::optional<Dictionary> overlay = enable(*build(spec), &row.host);
    ASSERT_TRUE(overlay);
    Dictionary expected = row.expected;
    expected.insert(fromContainer.begin(), fromContainer.end());
    EXPECT_EQ(serviceOf(*overlay)["EnvironmentVariables"], Value(expected));
  }
}

TEST_F(EnablingTest, ServiceManagerRefusalIsCode4AndLogged) {
  serviceManager_->addResult = EACCES;
  auto record = build();
  std::optional<EkError> error = record->enableForClient(*host_, nullptr);
  ASSERT_TRUE(error);
  EXPECT_EQ(*error, EkError::ekora(4, "unable to enable plug-in com.example.plugin(" +
                                          record->uuid().string() + ")"));
  EXPECT_TRUE(sink_->has(log::Level::Error, "ops",
                         "stard error 13 trying to allow " + std::to_string(getpid()) + " " +
                             host_->path() + " to use plug-in com.example.plugin(3.1) uuid=" +
                             record->uuid().string() + " at " + *record->path()));
  EXPECT_EQ(serviceManager_->declarations().size(), 1u);  // asked once, not retried
}

}  // namespace
}  // namespace ek
