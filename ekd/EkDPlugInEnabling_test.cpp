#include "ekd/EkDPlugInEnabling.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <unistd.h>

#include <asio/local/stream_protocol.hpp>
#include <cerrno>
#include <filesystem>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "ekd/EkDPlugIn.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"
#include "platform/log/testing/CapturingSink.h"
#include "platform/privo/Consent.h"
#include "platform/stard/ServiceManager.h"
#include "platform/vantor/FakeRegistry.h"

namespace ek {
namespace {

namespace fs = std::filesystem;

constexpr std::string_view kHostIdentifier = "com.example.host";
constexpr std::string_view kKeyboard = "com.corvane.keyboard-service";

class CapturingSink : public log::testing::CapturingSink {
 public:
  // Lines at level in category that begin with prefix.
  int countStarting(log::Level level, std::string_view category, std::string_view prefix) const {
    return countIf([&](const Line& line) {
      return line.level == level && line.category == category && line.message.starts_with(prefix);
    });
  }
};

// Answers a fixed list of instances, whatever is asked; records what was asked.
class ListingServiceManager final : public stard::ServiceManager {
 public:
  int addExternalService(pid_t, std::string_view, std::string_view, std::string_view,
                         const Dictionary&) override {
    return 0;
  }
  void removeExternalService(std::string_view, std::string_view, std::shared_ptr<SerialQueue>,
                             std::function<void(int)>) override {}
  Result<pid_t> launch(pid_t, std::string_view, const std::vector<std::string>&) override {
    return EkError::posix(ENOTSUP, "launch");
  }
  std::vector<stard::Instance> instances(const std::vector<std::string>& identifiers) override {
    asked.push_back(identifiers);
    return listed;
  }
  void pruneDeclarations() override {}
  std::vector<stard::Instance> listed;
  std::vector<std::vector<std::string>> asked;
};

// What a plug-in bundle on disk declares.
struct PlugInSpec {
  std::string identifier = "com.example.plugin";
  std::optional<std::string> point = "com.corvane.share";
  Dictionary attributes;
  std::optional<Value> wyreService;
  bool executable = true;
  bool dataOnly = false;
  bool inApplication = true;
};

class EnablingTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/ekd-enabling-test-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    root_ = fs::canonical(pattern);
    setenv("EKORA_RUNTIME_DIR", root_.c_str(), 1);
    setenv("EKORA_STATE_DIR", root_.c_str(), 1);
    unsetenv("EKTEST_SDK");
    log::setSink(sink_);
    log::configure("debug");

    EkDPlatform platform;
    platform.codeSigning = std::make_shared<FakeCodeSigning>();
    platform.sandbox = std::make_shared<FakeSandboxCheck>();
    platform.registry = std::make_shared<vantor::FakeRegistry>();
    platform.serviceManager = std::make_shared<stard::FakeServiceManager>();
    platform.notifier = std::make_shared<notify::FakeNotifier>();
    server_ = EkDServer::initForService("enabling-unit-server", std::nullopt, platform);
    ASSERT_TRUE(server_);
    client_ = connectClient();
    ASSERT_TRUE(client_);

    fs::create_directories(application());
    writeInfo(application(), Dictionary{{"QvBundleIdentifier", Value(kHostIdentifier)}});
  }
  void TearDown() override {
    client_.reset();
    for (int fd : peers_) close(fd);
    server_->stop();
    log::setSink(nullptr);
    log::configure("default");
    unsetenv("EKTEST_SDK");
    std::error_code ignored;
    fs::remove_all(root_, ignored);
  }

  std::shared_ptr<EkDWyreClient> connectClient() {
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

  fs::path application() const { return root_ / "Applications" / "Host.app"; }
  static void writeInfo(const fs::path& bundle, const Dictionary& info) {
    ASSERT_TRUE(dmap::writeFileAtomically((bundle / "Info.dmap").string(), Value(info)).ok());
  }

  std::shared_ptr<EkDPlugIn> plugIn(const PlugInSpec& spec) {
    const fs::path bundle =
        spec.inApplication ? application() / "PlugIns" / (spec.identifier + ".appex")
                           : root_ / "System" / "Library" / "PlugIns" / (spec.identifier + ".ek");
    fs::create_directories(bundle);
    Dictionary attributes = spec.attributes;
    attributes.emplace("ZuExtensionVersion", Value("3.1"));
    Dictionary extension{{"ZuExtensionAttributes", Value(attributes)}};
    if (spec.point) extension.emplace("ZuExtensionPointIdentifier", Value(*spec.point));
    extension.emplace("ZuExtensionProtocol",
                      Value(spec.dataOnly ? "#Data" : "com.example.Service"));
    Dictionary info{{"QvBundleIdentifier", Value(spec.identifier)},
                    {"QvBundleVersion", Value("3")},
                    {"ZuExtension", Value(extension)}};
    if (spec.executable) info.emplace("QvBundleExecutable", Value("Thing"));
    if (spec.wyreService) info.emplace("WyreService", *spec.wyreService);
    writeInfo(bundle, info);

    vantor::PlugInProxy proxy;
    proxy.uuid = Uuid::random();
    proxy.identifier = spec.identifier;
    proxy.originalIdentifier = spec.identifier;
    proxy.path = bundle.string();
    proxy.url = vantor::fileUrlForPath(proxy.path);
    if (spec.inApplication) proxy.containingAppPath = application().string();
    if (!spec.dataOnly) proxy.dataContainerPath = container(spec.identifier).string();
    proxy.extensionPoint = spec.point;
    proxy.info = std::move(info);
    registry_->install(proxy);

    EkDPlugInContext context;
    context.registry = registry_;
    context.systemRoot = (root_ / "System").string();
    context.serviceManager = serviceManager_;
    context.consent = consent_;
    auto record = EkDPlugIn::createWithVRData(proxy, std::move(context));
    EXPECT_NE(record, nullptr);
    return record;
  }
  fs::path container(const std::string& identifier) const {
    return root_ / "containers" / identifier;
  }

  // The overlay of the only declaration made so far.
  Dictionary onlyOverlay() const {
    auto declarations = serviceManager_->declarations();
    EXPECT_EQ(declarations.size(), 1u);
    return declarations.empty() ? Dictionary{} : declarations.front().overlay;
  }
  static const Dictionary& serviceOf(const Dictionary& overlay) {
    static const Dictionary empty;
    auto it = overlay.find("WyreService");
    return it != overlay.end() && it->second.dictionary() ? *it->second.dictionary() : empty;
  }
  static const Value* serviceEntry(const Dictionary& overlay, std::string_view key) {
    const Dictionary& service = serviceOf(overlay);
    auto it = service.find(key);
    return it == service.end() ? nullptr : &it->second;
  }
  static Dictionary environmentOf(const Dictionary& overlay) {
    const Value* variables = serviceEntry(overlay, "EnvironmentVariables");
    return variables && variables->dictionary() ? *variables->dictionary() : Dictionary{};
  }
  static std::string profileOf(const Dictionary& overlay) {
    const Value* profile = serviceEntry(overlay, "_SandboxProfile");
    return profile && profile->string() ? *profile->string() : "(none)";
  }

  std::string enabledProfile(const PlugInSpec& spec) {
    auto record = plugIn(spec);
    if (!record) return "(no record)";
    const size_t before = serviceManager_->declarations().size();
    EXPECT_EQ(record->enableForClient(*client_->process(), nullptr), std::nullopt);
    auto declarations = serviceManager_->declarations();
    if (declarations.size() != before + 1) return "(not declared)";
    return profileOf(declarations.back().overlay);
  }

  fs::path root_;
  std::shared_ptr<CapturingSink> sink_ = std::make_shared<CapturingSink>();
  std::shared_ptr<vantor::FakeRegistry> registry_ = std::make_shared<vantor::FakeRegistry>();
  std::shared_ptr<stard::FakeServiceManager> serviceManager_ =
      std::make_shared<stard::FakeServiceManager>();
  std::shared_ptr<privo::FakeConsent> consent_ = std::make_shared<privo::FakeConsent>();
  std::shared_ptr<EkDServer> server_;
  std::shared_ptr<EkDWyreClient> client_;
  std::vector<int> peers_;
};

// ---- Sandbox profiles ------------------------------------------------------------------------

TEST_F(EnablingTest, ProfileFollowsTheExtensionPoint) {
  struct Row {
    std::optional<std::string> point;
    std::string profile;
  };
  const Row rows[] = {
      {std::string(kKeyboard), "keyboard"},
      {"com.corvane.netguard.filter-data", "network-filter"},
      {"com.corvane.peekview.extension.preview", "peekviewd"},
      {"com.corvane.peekview.preview", "peekview-preview"},
      {"com.corvane.peekview.thumbnail", "peekview-thumbnail"},
      {"com.corvane.app.non-ui-extension", "sandpit-devtools"},
      {"com.corvane.app.non-ui-extension.multiple-instances", "sandpit-devtools"},
      {"com.corvane.callscreen.message-filter", "message-filter"},
      {"com.corvane.share", "plugin"},
      {"com.corvane.peekview", "plugin"},
      {std::nullopt, "plugin"},
  };
  int n = 0;
  for (const Row& row : rows) {
    PlugInSpec spec;
    spec.identifier = "com.example.profile" + std::to_string(n++);
    spec.point = row.point;
    EXPECT_EQ(enabledProfile(spec), row.profile) << row.point.value_or("(no point)");
  }
}

TEST(SandboxProfileTest, KeyboardAndNetworkFilterFollowTheCurrentPointOthersTheStoredOne) {
  auto never = [] { return false; };
  EXPECT_EQ(enabling::sandboxProfileFor("", std::string(kKeyboard), false, never), "plugin");
  EXPECT_EQ(enabling::sandboxProfileFor(std::string(kKeyboard), "", false, never), "keyboard");
  EXPECT_EQ(enabling::sandboxProfileFor("", "com.corvane.netguard.filter-data", false, never),
            "plugin");
  EXPECT_EQ(enabling::sandboxProfileFor("com.corvane.peekview.thumbnail", "", false, never),
            "plugin");
  EXPECT_EQ(enabling::sandboxProfileFor("", "com.corvane.peekview.thumbnail", false, never),
            "peekview-thumbnail");
}

TEST_F(EnablingTest, KeyboardLeavesItsSandboxOnlyWithOpenAccessAndNetworkConsent) {
  struct Row {
    const char* name;
    std::optional<Value> requestsOpenAccess;
    bool granted;
    std::string profile;
    bool consentAsked;
  };
  const Row rows[] = {
      {"asks and granted", Value(true), true, "plugin", true},
      {"asks, not granted", Value(true), false, "keyboard", true},
      {"does not ask, granted", Value(false), true, "keyboard", false},
      {"silent, granted", std::nullopt, true, "keyboard", false},
      {"asks with a string", Value("true"), true, "keyboard", false},
  };
  int n = 0;
  for (const Row& row : rows) {
    consent_ = std::make_shared<privo::FakeConsent>();
    if (row.granted)
      consent_->grant(std::string(kHostIdentifier), "com.corvane.privo.keyboard-network");
    consent_->grant(std::string(kHostIdentifier), "com.corvane.privo.camera");
    PlugInSpec spec;
    spec.identifier = "com.example.keyboard" + std::to_string(n++);
    spec.point = std::string(kKeyboard);
    if (row.requestsOpenAccess)
      spec.attributes.emplace("RequestsOpenAccess", *row.requestsOpenAccess);
    EXPECT_EQ(enabledProfile(spec), row.profile) << row.name;
    EXPECT_EQ(!consent_->queries().empty(), row.consentAsked) << row.name;
  }
}

TEST_F(EnablingTest, AllowedPrivoServicesAreThoseOfTheContainingApplication) {
  consent_->grant(std::string(kHostIdentifier), "com.corvane.privo.keyboard-network");
  consent_->grant("com.example.elsewhere", "com.corvane.privo.camera");
  auto record = plugIn({});
  ASSERT_TRUE(record);
  EXPECT_EQ(record->allowedPrivoServices(),
            std::vector<std::string>{"com.corvane.privo.keyboard-network"});
  EXPECT_EQ(consent_->queries(), std::vector<std::string>{std::string(kHostIdentifier)});
}

TEST_F(EnablingTest, PlugInOutsideAnyApplicationHasNoPrivoServices) {
  consent_->grant(std::string(kHostIdentifier), "com.corvane.privo.keyboard-network");
  PlugInSpec spec;
  spec.inApplication = false;
  auto record = plugIn(spec);
  ASSERT_TRUE(record);
  EXPECT_TRUE(record->allowedPrivoServices().empty());
  EXPECT_TRUE(consent_->queries().empty());
}

TEST_F(EnablingTest, UnreadableApplicationBundleGrantsNothingAndIsLogged) {
  consent_->grant(std::string(kHostIdentifier), "com.corvane.privo.keyboard-network");
  auto record = plugIn({});
  ASSERT_TRUE(record);
  fs::remove(application() / "Info.dmap");
  EXPECT_TRUE(record->allowedPrivoServices().empty());
  EXPECT_TRUE(
      sink_->has(log::Level::Info, "ops", "failed to create bundle for " + record->path().value()));
  EXPECT_TRUE(consent_->queries().empty());
}

TEST_F(EnablingTest, ConsentAnsweringNothingGrantsNothingAndIsLogged) {
  for (const bool serviceExists : {false, true}) {
    consent_ = serviceExists ? std::make_shared<privo::FakeConsent>() : nullptr;
    if (consent_) {
      consent_->grant(std::string(kHostIdentifier), "com.corvane.privo.keyboard-network");
      consent_->setUnavailable(true);
    }
    PlugInSpec spec;
    spec.identifier += serviceExists ? ".asked" : ".unasked";
    auto record = plugIn(spec);
    ASSERT_TRUE(record);
    EXPECT_TRUE(record->allowedPrivoServices().empty());
    EXPECT_EQ(sink_->countStarting(
                  log::Level::Info, "ops",
                  "PrivoAccessCopyInformationForBundle failed for " + application().string()),
              serviceExists ? 2 : 1);
  }
}

// ---- The overlay ---------------------------------------------------------------------------

TEST_F(EnablingTest, OverlayDeclaresTheExecutableForTheHost) {
  PlugInSpec spec;
  spec.wyreService = Value(Dictionary{{"Custom", Value(5)},
                                      {"_SandboxProfile", Value("unconfined")},
                                      {"_OmitSandboxParameters", Value(false)}});
  auto record = plugIn(spec);
  ASSERT_TRUE(record);
  EXPECT_EQ(record->enableForClient(*client_->process(), nullptr), std::nullopt);

  auto declarations = serviceManager_->declarations();
  ASSERT_EQ(declarations.size(), 1u);
  const auto& declaration = declarations.front();
  EXPECT_EQ(declaration.hostPid, getpid());
  EXPECT_EQ(declaration.hostPath, client_->process()->path());
  EXPECT_FALSE(declaration.hostPath.empty());
  EXPECT_EQ(declaration.bundleIdentifier, spec.identifier);
  EXPECT_EQ(declaration.program, *record->path() + "/Thing");

  const Dictionary& overlay = declaration.overlay;
  EXPECT_EQ(overlay.size(), 2u);
  EXPECT_EQ(overlay.at("QvBundlePackageType"), Value("WYR!"));
  const Dictionary& service = serviceOf(overlay);
  EXPECT_EQ(service.size(), 4u);
  EXPECT_EQ(service.at("Custom"), Value(5));
  EXPECT_EQ(service.at("_SandboxProfile"), Value("plugin"));
  EXPECT_EQ(service.at("_OmitSandboxParameters"), Value(true));
  EXPECT_TRUE(service.at("EnvironmentVariables").dictionary() != nullptr);
  EXPECT_TRUE(sink_->has(log::Level::Info, "ops",
                         "assigning plug-in com.example.plugin(3.1) " + record->uuid().string() +
                             " to plugin sandbox"));
  EXPECT_EQ(sink_->countStarting(log::Level::Default, "ops",
                                 "allowing host " + std::to_string(getpid()) + " "),
            1);
  EXPECT_EQ(sink_->countStarting(log::Level::Debug, "ops", "activation overlay="), 1);
  EXPECT_EQ(sink_->countStarting(log::Level::Debug, "vr", "raw WyreService="), 1);
}

TEST_F(EnablingTest, HostEnvironmentCannotReplaceTheContainerVariables) {
  auto record = plugIn({});
  ASSERT_TRUE(record);
  const Dictionary host{{"HOME", Value("/home/host")},
                        {"TMPDIR", Value("/tmp/host")},
                        {"LANG", Value("de_DE.UTF-8")}};
  EXPECT_EQ(record->enableForClient(*client_->process(), &host), std::nullopt);
  const std::string home = container("com.example.plugin").string();
  EXPECT_EQ(environmentOf(onlyOverlay()), (Dictionary{{"HOME", Value(home)},
                                                      {"QVFIXED_USER_HOME", Value(home)},
                                                      {"TMPDIR", Value(home + "/tmp")},
                                                      {"LANG", Value("de_DE.UTF-8")}}));
}

TEST_F(EnablingTest, PlugInVariablesWinOverContainerAndHost) {
  PlugInSpec spec;
  spec.wyreService =
      Value(Dictionary{{"EnvironmentVariables", Value(Dictionary{{"HOME", Value("/plugin/home")},
                                                                 {"LANG", Value("pl_PL.UTF-8")},
                                                                 {"COUNT", Value(3)}})}});
  auto record = plugIn(spec);
  ASSERT_TRUE(record);
  const Dictionary host{{"LANG", Value("de_DE.UTF-8")}, {"COUNT", Value("host")}};
  EXPECT_EQ(record->enableForClient(*client_->process(), &host), std::nullopt);
  const Dictionary environment = environmentOf(onlyOverlay());
  EXPECT_EQ(environment.at("HOME"), Value("/plugin/home"));
  EXPECT_EQ(environment.at("QVFIXED_USER_HOME"), Value(container(spec.identifier).string()));
  EXPECT_EQ(environment.at("LANG"), Value("pl_PL.UTF-8"));
  // The plug-in's non-string value is ignored, so the host's string stays.
  EXPECT_EQ(environment.at("COUNT"), Value("host"));
}

TEST_F(EnablingTest, PlugInEnvironmentThatIsNotADictionaryIsIgnored) {
  PlugInSpec spec;
  spec.wyreService = Value(Dictionary{{"EnvironmentVariables", Value("HOME=/x")}});
  auto record = plugIn(spec);
  ASSERT_TRUE(record);
  const Dictionary host{{"LANG", Value("C")}};
  EXPECT_EQ(record->enableForClient(*client_->process(), &host), std::nullopt);
  const Dictionary environment = environmentOf(onlyOverlay());
  EXPECT_EQ(environment.at("HOME"), Value(container(spec.identifier).string()));
  EXPECT_EQ(environment.at("LANG"), Value("C"));
}

TEST_F(EnablingTest, HostValuesThatAreNotCarriableStringsAreDropped) {
  auto record = plugIn({});
  ASSERT_TRUE(record);
  const Dictionary host{{"NUMBER", Value(7)},
                        {"FLAG", Value(true)},
                        {"NESTED", Value(Dictionary{{"a", Value("b")}})},
                        {"LIST", Value(Array{Value("x")})},
                        {"A=B", Value("equals in the name")},
                        {"", Value("empty name")},
                        {"CONTROL", Value(std::string("a\x01z"))},
                        {"NUL", Value(std::string("a\0z", 3))},
                        {"BADUTF8", Value(std::string("\xff\xfe"))},
                        {"KEPT", Value("<&>\"' \t\nline")}};
  EXPECT_EQ(record->enableForClient(*client_->process(), &host), std::nullopt);
  Dictionary environment = environmentOf(onlyOverlay());
  environment.erase("HOME");
  environment.erase("QVFIXED_USER_HOME");
  environment.erase("TMPDIR");
  EXPECT_EQ(environment, (Dictionary{{"KEPT", Value("<&>\"' \t\nline")}}));
}

TEST_F(EnablingTest, DaemonTestSdkIsPassedOn) {
  setenv("EKTEST_SDK", "/sdk/path", 1);
  auto record = plugIn({});
  ASSERT_TRUE(record);
  const Dictionary host{{"EKTEST_SDK", Value("/host/sdk")}};
  EXPECT_EQ(record->enableForClient(*client_->process(), &host), std::nullopt);
  EXPECT_EQ(environmentOf(onlyOverlay()).at("EKTEST_SDK"), Value("/sdk/path"));
}

TEST_F(EnablingTest, PlugInWithoutDataContainerGetsNoHome) {
  PlugInSpec spec;
  spec.dataOnly = true;
  auto record = plugIn(spec);
  ASSERT_TRUE(record);
  ASSERT_FALSE(record->dataContainerURL());
  const Dictionary host{{"HOME", Value("/home/host")}};
  EXPECT_EQ(record->enableForClient(*client_->process(), &host), std::nullopt);
  EXPECT_EQ(environmentOf(onlyOverlay()), (Dictionary{{"HOME", Value("/home/host")}}));
  EXPECT_TRUE(sink_->has(log::Level::Debug, "ops",
                         "no data container for plug-in com.example.plugin(3.1) " +
                             record->uuid().string() + " at " + *record->path()));
}

TEST_F(EnablingTest, MissingWyreServiceStartsFromAnEmptyService) {
  PlugInSpec spec;
  spec.wyreService = Value("not a dictionary");
  auto record = plugIn(spec);
  ASSERT_TRUE(record);
  EXPECT_EQ(record->enableForClient(*client_->process(), nullptr), std::nullopt);
  const Dictionary overlay = onlyOverlay();
  const Dictionary& service = serviceOf(overlay);
  EXPECT_EQ(service.size(), 3u);
  EXPECT_TRUE(sink_->has(log::Level::Info, "ops",
                         "no WyreService for plug-in; database returned not a dictionary"));
}

// ---- Failures ------------------------------------------------------------------------------

TEST_F(EnablingTest, ServiceManagerRefusalIsCode4AndLogged) {
  serviceManager_->addResult = EACCES;
  auto record = plugIn({});
  ASSERT_TRUE(record);
  std::optional<EkError> error = record->enableForClient(*client_->process(), nullptr);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain, "Ekora");
  EXPECT_EQ(error->code, 4);
  EXPECT_EQ(error->message,
            "unable to enable plug-in com.example.plugin(" + record->uuid().string() + ")");
  EXPECT_TRUE(sink_->has(log::Level::Error, "ops",
                         "stard error 13 trying to allow " + std::to_string(getpid()) + " " +
                             client_->process()->path() +
                             " to use plug-in com.example.plugin(3.1) uuid=" +
                             record->uuid().string() + " at " + *record->path()));
  EXPECT_EQ(serviceManager_->declarations().size(), 1u);  // asked once, not retried
}

TEST_F(EnablingTest, PlugInWithoutExecutableIsDeclaredWithItsBundlePath) {
  PlugInSpec spec;
  spec.executable = false;
  auto record = plugIn(spec);
  ASSERT_TRUE(record);
  EXPECT_EQ(record->enableForClient(*client_->process(), nullptr), std::nullopt);
  auto declarations = serviceManager_->declarations();
  ASSERT_EQ(declarations.size(), 1u);
  EXPECT_EQ(declarations.front().program, *record->path());
  EXPECT_EQ(sink_->countStarting(log::Level::Error, "ops", "failed to obtain execPath for plug-in"),
            0);
}

// ---- The real service manager --------------------------------------------------------------

TEST_F(EnablingTest, DeclarationFileStaysReadableWithOddEnvironmentValues) {
  auto files = std::make_shared<stard::FileServiceManager>((root_ / "runtime").string());
  serviceManager_ = nullptr;
  PlugInSpec spec;
  auto record = [&] {
    auto made = plugIn(spec);
    EkDPlugInContext context = made->context();
    context.serviceManager = files;
    return EkDPlugIn::createWithVRData(*registry_->plugInByUuid(made->uuid()), context);
  }();
  ASSERT_TRUE(record);
  const std::string odd = "</string><string>&amp;]]>\t\r\n\xc3\xa9\xe2\x82\xac";
  const Dictionary host{{"ODD", Value(odd)},
                        {"CONTROL", Value(std::string("\x1b[0m"))},
                        {"BADUTF8", Value(std::string("\xc3"))},
                        {"NUMBER", Value(-4)}};
  EXPECT_EQ(record->enableForClient(*client_->process(), &host), std::nullopt);
  std::optional<Dictionary> declaration = files->declaration(getpid(), spec.identifier);
  ASSERT_TRUE(declaration);
  auto overlay = declaration->find("overlay");
  ASSERT_TRUE(overlay != declaration->end() && overlay->second.dictionary());
  Dictionary environment = environmentOf(*overlay->second.dictionary());
  EXPECT_EQ(environment.at("ODD"), Value(odd));
  EXPECT_FALSE(environment.contains("CONTROL"));
  EXPECT_FALSE(environment.contains("BADUTF8"));
  EXPECT_FALSE(environment.contains("NUMBER"));
  EXPECT_EQ(profileOf(*overlay->second.dictionary()), "plugin");
}

// ---- Busy check ----------------------------------------------------------------------------

TEST_F(EnablingTest, NotBusyWithoutInstances) {
  auto record = plugIn({});
  ASSERT_TRUE(record);
  serviceManager_->addInstance({4242, "com.example.unrelated", getpid(), "/bin/true"});
  EXPECT_EQ(record->checkBusy(), std::nullopt);
}

TEST_F(EnablingTest, BusyInstanceIsReportedByBundleIdentifier) {
  auto record = plugIn({});
  ASSERT_TRUE(record);
  serviceManager_->addInstance({4242, "com.example.plugin", getpid(), "/bin/true"});
  serviceManager_->addInstance({4243, "com.example.plugin", getpid(), "/bin/true"});
  EXPECT_EQ(record->checkBusy(),
            (Dictionary{{"StardExtensionBundleIdentifier", Value("com.example.plugin")}}));
}

TEST_F(EnablingTest, InstanceWithoutBundleIdentifierIsSkippedAndLogged) {
  auto listing = std::make_shared<ListingServiceManager>();
  auto made = plugIn({});
  ASSERT_TRUE(made);
  EkDPlugInContext context = made->context();
  context.serviceManager = listing;
  auto record = EkDPlugIn::createWithVRData(*registry_->plugInByUuid(made->uuid()), context);
  ASSERT_TRUE(record);

  listing->listed = {{10, "", getpid(), "/bin/true"}};
  EXPECT_EQ(record->checkBusy(), std::nullopt);
  EXPECT_TRUE(sink_->has(log::Level::Error, "ops",
                         "grantd reported incomplete bundle for plug-in com.example.plugin/" +
                             record->uuid().string()));
  ASSERT_EQ(listing->asked.size(), 1u);
  EXPECT_EQ(listing->asked[0], std::vector<std::string>{"com.example.plugin"});

  listing->listed = {{10, "", getpid(), "/bin/true"}, {11, "com.example.second", getpid(), ""}};
  EXPECT_EQ(record->checkBusy(),
            (Dictionary{{"StardExtensionBundleIdentifier", Value("com.example.second")}}));
}

}  // namespace
}  // namespace ek
