// Runs arbitrary CBOR requests through the daemon's request handlers: each input is decoded and
// dispatched as a transaction of a real server built on platform doubles, with a registry of a
// few plug-ins whose bundles exist on disk (inside applications and on the system volume, with
// entitlements, attributes, an activation rule, a data-only one and some that cannot be
// enabled). The reply is read back from the client's socket and must come exactly once, within
// a bounded time, as a dictionary whose "errorcode", when present, is a number explained by a
// string "error".
//
// An unsigned "fuzz-client" member (ignored by the daemon) picks the requesting client, each
// with its own entitlements and sandbox state. Holds placed by an input are released and the
// stored annotations put back after it, so every input runs against the same state.
#include <poll.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <asio/local/stream_protocol.hpp>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <future>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "Ekora/EkProtocol.h"
#include "Ekora/EkSandbox.h"
#include "Ekora/EkSandboxKey.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDUserPrefs.h"
#include "ekd/EkDWyreClient.h"
#include "ekd/Transaction.h"
#include "platform/cbor/Cbor.h"
#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"
#include "platform/prefs/Preferences.h"
#include "platform/privo/Consent.h"
#include "platform/types/TypeSystem.h"
#include "platform/vantor/FakeRegistry.h"
#include "platform/wyre/Wyre.h"

namespace {

using namespace std::chrono_literals;

// A handler that has not replied by then never will: a bug, reported as a crash.
constexpr auto kReplyTimeout = 10s;
constexpr std::string_view kClientKey = "fuzz-client";
constexpr std::string_view kFixedRoot = "ekora-dispatch-fuzz";

[[noreturn]] void fail(const char* what) {
  std::fprintf(stderr, "dispatch_fuzz: %s\n", what);
  std::abort();
}

class NullSink : public ek::log::Sink {
 public:
  void write(const ek::log::Record&) override {}
};

// Registration answers without keeping the paths it was asked for (the registry's test double
// remembers every one).
class FuzzRegistry : public ek::vantor::FakeRegistry {
 public:
  ek::Result<void> registerBundle(const std::string& path) override { return answer(path); }
  ek::Result<void> unregisterBundle(const std::string& path) override { return answer(path); }

 private:
  static ek::Result<void> answer(const std::string& path) {
    if (path.ends_with(".appex") || path.ends_with(".app") || path.ends_with(".bundle")) return {};
    return ek::vantor::makeError(ek::vantor::kMalformedBundle, "not a bundle: " + path);
  }
};

// Declarations and removals are answered from the bundle identifier and not recorded, so the
// double does not grow run after run.
class FuzzServiceManager final : public ek::stard::ServiceManager {
 public:
  int addExternalService(pid_t, std::string_view, std::string_view bundleIdentifier,
                         std::string_view, const ek::Dictionary&) override {
    return bundleIdentifier.find("broken") != std::string_view::npos ? EPERM : ek::stard::kSuccess;
  }
  void removeExternalService(std::string_view bundleIdentifier, std::string_view,
                             std::shared_ptr<ek::SerialQueue> queue,
                             std::function<void(int)> answer) override {
    int result = ek::stard::kNoSuchProcess;
    if (bundleIdentifier.find("broken") != std::string_view::npos) result = EPERM;
    if (bundleIdentifier.find("share") != std::string_view::npos) result = ek::stard::kSuccess;
    queue->async([answer = std::move(answer), result] { answer(result); });
  }
  ek::Result<pid_t> launch(pid_t, std::string_view, const std::vector<std::string>&) override {
    return ek::EkError::posix(ENOTSUP, "no launches while fuzzing");
  }
  std::vector<ek::stard::Instance> instances(const std::vector<std::string>& identifiers) override {
    std::vector<ek::stard::Instance> running;
    for (const std::string& identifier : identifiers) {
      if (identifier.find("broken") != std::string::npos) {
        running.push_back({1, identifier, 1, "/bin/true"});
      } else if (identifier.find("noexec") != std::string::npos) {
        running.push_back({1, "", 1, "/bin/true"});  // an incomplete report
      }
    }
    return running;
  }
  void pruneDeclarations() override {}
};

class CountingNotifier final : public ek::notify::Notifier {
 public:
  void post(std::string_view) override { posts_.fetch_add(1, std::memory_order_relaxed); }

 private:
  std::atomic<uint64_t> posts_{0};
};

class FixedConsent final : public ek::privo::Consent {
 public:
  std::vector<std::string> grantedServices(std::string_view application) override {
    if (application == "com.example.host") return {std::string(ek::privo::kKeyboardNetworkService)};
    return {};
  }
};

struct PlugInSpec {
  const char* uuid;
  const char* identifier;
  const char* relativePath;  // below the fixture root
  const char* application;   // relative path of the containing application, or nullptr
  const char* version;
  const char* point;
  bool onDisk;
  bool withExecutable;
};

// The UUIDs and paths are the ones the seed corpus names (fuzz/make_corpus.py).
constexpr PlugInSpec kPlugIns[] = {
    {"d15a7c4e-0000-4000-8000-000000000001", "com.example.host.share",
     "Applications/Host.app/PlugIns/Share.appex", "Applications/Host.app", "2", "com.corvane.share",
     true, true},
    {"d15a7c4e-0000-4000-8000-000000000002", "com.example.host.keyboard",
     "Applications/Host.app/PlugIns/Keyboard.appex", "Applications/Host.app", "1",
     "com.corvane.keyboard-service", true, true},
    {"d15a7c4e-0000-4000-8000-000000000003", "com.example.host.share",
     "Applications/Other.app/PlugIns/Share.appex", "Applications/Other.app", "3",
     "com.corvane.share", true, true},
    {"d15a7c4e-0000-4000-8000-000000000004", "com.example.other.dedicated",
     "Applications/Other.app/PlugIns/Dedicated.appex", "Applications/Other.app", "1",
     "com.corvane.share", true, true},
    {"d15a7c4e-0000-4000-8000-000000000005", "com.example.system.viewer",
     "System/Library/PlugIns/Viewer.bundle", nullptr, "1.10", "com.corvane.peekview.preview", true,
     true},
    {"d15a7c4e-0000-4000-8000-000000000006", "com.example.system.data",
     "System/Library/PlugIns/Data.bundle", nullptr, "1", "com.corvane.share", true, false},
    {"d15a7c4e-0000-4000-8000-000000000007", "com.example.other.excluded",
     "Applications/Other.app/PlugIns/Excluded.appex", "Applications/Other.app", "1",
     "com.example.excluded", true, true},
    {"d15a7c4e-0000-4000-8000-000000000008", "com.example.other.broken",
     "Applications/Other.app/PlugIns/Broken.appex", "Applications/Other.app", "1",
     "com.corvane.share", true, true},
    {"d15a7c4e-0000-4000-8000-000000000009", "com.example.host.missing",
     "Applications/Host.app/PlugIns/Missing.appex", "Applications/Host.app", "1",
     "com.corvane.share", false, false},
    {"d15a7c4e-0000-4000-8000-00000000000a", "com.example.host.noexec",
     "Applications/Host.app/PlugIns/NoExec.appex", "Applications/Host.app", "1",
     "com.corvane.share", true, false},
};

// Entitlements of the clients "fuzz-client" picks from, and whether each is sandboxed.
struct ClientSpec {
  ek::Dictionary entitlements;
  bool sandboxed;
};

std::vector<ClientSpec> clientSpecs() {
  using ek::Dictionary;
  using ek::Value;
  namespace protocol = ek::protocol;
  return {
      {Dictionary{}, false},
      {Dictionary{{std::string(protocol::kEntitlementManager), Value(true)},
                  {std::string(protocol::kEntitlementProvideEnvironment), Value(true)},
                  {"com.example.host-entitlement", Value(true)}},
       false},
      {Dictionary{{std::string(protocol::kEntitlementManager), Value(true)},
                  {std::string(protocol::kEntitlementAllowedPlugIns),
                   Value(Dictionary{{"ZuExtensionPointIdentifier", Value("com.corvane.share")}})}},
       true},
      {Dictionary{{std::string(protocol::kEntitlementAllowedPlugIns), Value("everything")},
                  {std::string(protocol::kEntitlementProvideEnvironment), Value(0)}},
       true},
  };
}

std::string makeDirectories(const std::string& path) {
  std::string partial;
  size_t position = 0;
  while (position != std::string::npos) {
    position = path.find('/', position + 1);
    partial = path.substr(0, position);
    if (::mkdir(partial.c_str(), 0755) != 0 && errno != EEXIST) fail("cannot create directory");
  }
  return path;
}

void writeInfo(const std::string& bundle, const ek::Dictionary& info) {
  makeDirectories(bundle);
  if (!ek::dmap::writeFileAtomically(bundle + "/Info.dmap", ek::Value(info))) {
    fail("cannot write Info.dmap");
  }
}

ek::Dictionary plugInInfo(const PlugInSpec& spec) {
  using ek::Array;
  using ek::Dictionary;
  using ek::Value;
  const std::string identifier = spec.identifier;
  Dictionary attributes{
      {"ZuExtensionPointIdentifier", Value(spec.point)},
      {"Kind", Value(identifier.find("share") != std::string::npos ? "viewer" : "editor")},
      {"Count", Value(5)},
      {"Ratio", Value(1.5)},
      {"Level", Value(identifier.find("host") != std::string::npos ? "10" : "2")},
      {"Release", Value(spec.version)},
      {"Flag", Value(false)},
      {"Types", Value(Array{Value("public.image"), Value("public.movie")})},
      {"ZuExtensionActivationRule",
       Value(Dictionary{{"public.image", Value(2)}, {"public.movie", Value(true)}})},
  };
  if (identifier.find("keyboard") != std::string::npos) {
    attributes.insert_or_assign("RequestsOpenAccess", Value(true));
  }
  Dictionary extension{
      {"ZuExtensionPointIdentifier", Value(spec.point)},
      {"ZuExtensionAttributes", Value(std::move(attributes))},
  };
  if (identifier.find("keyboard") != std::string::npos) {
    extension.insert_or_assign("ZuExtensionHostEntitlement", Value("com.example.host-entitlement"));
  }
  if (identifier.find("dedicated") != std::string::npos) {
    extension.insert_or_assign("Dedicated", Value(true));
  }
  if (identifier.find("system") != std::string::npos) {
    extension.insert_or_assign(
        "ZuExtensionProtocol",
        Value(identifier.find("data") != std::string::npos ? "#Data" : "ZuObject"));
  }
  Dictionary info{
      {"QvBundleIdentifier", Value(identifier)},
      {"QvBundleVersion", Value(spec.version)},
      {"QvBundleName", Value(identifier.substr(identifier.rfind('.') + 1))},
      {"ZuExtension", Value(std::move(extension))},
  };
  if (identifier.find("keyboard") != std::string::npos) {
    info.insert_or_assign(
        "WyreService",
        Value(Dictionary{{"EnvironmentVariables",
                          Value(Dictionary{{"LANG", Value("C")}, {"BAD=NAME", Value("x")}})}}));
  }
  return info;
}

ek::Dictionary plugInEntitlements(const PlugInSpec& spec) {
  using ek::Dictionary;
  using ek::Value;
  const std::string_view identifier = spec.identifier;
  const std::string_view uuid = spec.uuid;
  if (uuid.ends_with("01")) {
    return Dictionary{{std::string(ek::protocol::kEntitlementAutoElect), Value(true)}};
  }
  if (uuid.ends_with("03")) {
    return Dictionary{
        {std::string(ek::protocol::kEntitlementReplacePlugIn), Value("com.example.system.viewer")}};
  }
  if (identifier.find("viewer") != std::string_view::npos) {
    return Dictionary{{std::string(ek::protocol::kEntitlementReplacePlugIn),
                       Value(ek::Array{Value("com.example.other.excluded"), Value(7)})},
                      {"com.example.flag", Value(true)}};
  }
  return {};
}

struct Fixture {
  std::string root;  // canonical
  std::shared_ptr<FuzzRegistry> registry = std::make_shared<FuzzRegistry>();
  std::shared_ptr<ek::FakeSandboxCheck> sandbox = std::make_shared<ek::FakeSandboxCheck>();
  std::shared_ptr<ek::EkDServer> server;
  std::vector<std::shared_ptr<ek::EkDWyreClient>> clients;
  std::vector<bool> sandboxed;
  std::vector<int> peers;
  std::vector<std::shared_ptr<ek::EkDPlugIn>> plugIns;
  ek::Dictionary baselineAnnotations;
  uint64_t nextId = 1;
  // EKORA_DISPATCH_FUZZ_VERBOSE prints every reply, to see what seeds reach.
  bool verbose = std::getenv("EKORA_DISPATCH_FUZZ_VERBOSE") != nullptr;
};

// The bundles live under a fixed directory, so that seeds can name real paths; a fresh state
// and runtime directory per process keeps concurrent runs apart.
std::string prepareRoot() {
  struct stat status;
  const std::string base =
      ::stat("/dev/shm", &status) == 0 && S_ISDIR(status.st_mode) ? "/dev/shm" : "/tmp";
  const std::string root = makeDirectories(base + "/" + std::string(kFixedRoot));
  char* resolved = ::realpath(root.c_str(), nullptr);
  if (!resolved) fail("cannot resolve the fixture root");
  std::string canonical(resolved);
  std::free(resolved);

  writeInfo(canonical + "/Applications/Host.app",
            {{"QvBundleIdentifier", ek::Value("com.example.host")},
             {"QvBundleExecutable", ek::Value("Host")}});
  writeInfo(canonical + "/Applications/Other.app",
            {{"QvBundleIdentifier", ek::Value("com.example.other")},
             {"QvBundleExecutable", ek::Value("Other")}});
  makeDirectories(canonical + "/Applications/Empty.app");
  for (const PlugInSpec& spec : kPlugIns) {
    if (!spec.onDisk) continue;
    ek::Dictionary info = plugInInfo(spec);
    if (spec.withExecutable) {
      std::string_view name = spec.relativePath;
      name = name.substr(name.rfind('/') + 1);
      info.insert_or_assign("QvBundleExecutable", ek::Value(name.substr(0, name.find('.'))));
    }
    writeInfo(canonical + "/" + spec.relativePath, info);
  }
  return canonical;
}

// The state and runtime directory of this process, removed when it exits normally.
std::string& stateDirectory() {
  static std::string path;
  return path;
}

std::string temporaryDirectory(const std::string& base) {
  std::string pattern = base + "/ekora-dispatch-XXXXXX";
  if (!::mkdtemp(pattern.data())) fail("cannot create a temporary directory");
  stateDirectory() = pattern;
  std::atexit([] {
    std::error_code ignored;
    std::filesystem::remove_all(stateDirectory(), ignored);
  });
  return pattern;
}

std::shared_ptr<ek::EkDWyreClient> connectClient(Fixture& f) {
  int fds[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) fail("socketpair");
  f.peers.push_back(fds[1]);
  asio::local::stream_protocol::socket socket(ek::wyre::ioContext());
  socket.assign(asio::local::stream_protocol(), fds[0]);
  auto token = ek::AuditToken::forSocket(fds[0]);
  if (!token) fail("no audit token");
  return ek::EkDWyreClient::initWithConnection(
      ek::wyre::Connection::adopt(std::move(socket), std::move(*token)), f.server);
}

void waitFor(std::future<void> future) {
  if (future.wait_for(kReplyTimeout) != std::future_status::ready) fail("a queue never drained");
}

// Runs work on the server's work queue, where every request runs, and waits for it.
void onWorkQueue(Fixture& f, std::function<void()> work) {
  auto done = std::make_shared<std::promise<void>>();
  auto future = done->get_future();
  f.server->submitWork([done, work = std::move(work)] {
    work();
    done->set_value();
  });
  waitFor(std::move(future));
}

void installPlugIns(Fixture& f) {
  for (const char* app : {"Applications/Host.app", "Applications/Other.app"}) {
    ek::vantor::ApplicationProxy proxy;
    proxy.path = f.root + "/" + app;
    proxy.identifier = std::string_view(app).find("Host") != std::string_view::npos
                           ? "com.example.host"
                           : "com.example.other";
    proxy.name = proxy.identifier.substr(proxy.identifier.rfind('.') + 1);
    f.registry->addApplication(std::move(proxy));
  }
  f.registry->setExtensionPointSdk(
      "com.corvane.share",
      ek::Dictionary{
          {"ZuExtension", ek::Value(ek::Dictionary{
                              {"ZuExtensionAttributes",
                               ek::Value(ek::Dictionary{{"SdkDefault", ek::Value("yes")}})}})}});
  for (const PlugInSpec& spec : kPlugIns) {
    ek::vantor::PlugInProxy proxy;
    proxy.uuid = *ek::Uuid::parse(spec.uuid);
    proxy.identifier = spec.identifier;
    proxy.originalIdentifier = spec.identifier;
    proxy.bundleVersion = spec.version;
    proxy.path = f.root + "/" + spec.relativePath;
    proxy.url = ek::vantor::fileUrlForPath(proxy.path);
    if (spec.application) {
      proxy.containingAppPath = f.root + "/" + spec.application;
      proxy.containingAppName = "App";
    } else {
      proxy.onSystemVolume = true;
    }
    proxy.info = plugInInfo(spec);
    proxy.entitlements = plugInEntitlements(spec);
    if (std::string_view(spec.identifier).find("data") == std::string_view::npos) {
      proxy.dataContainerPath = f.root + "/containers/" + spec.identifier;
    }
    proxy.localizedName = std::string(spec.identifier) + " name";
    proxy.extensionPoint = spec.point;
    f.registry->install(std::move(proxy));
  }
  // The server learns of them from the registry's notices.
  std::promise<void> drained;
  f.registry->queue()->async([&] { drained.set_value(); });
  waitFor(drained.get_future());
  for (const PlugInSpec& spec : kPlugIns) {
    auto plugIn = f.server->database().findPlugIn(*ek::Uuid::parse(spec.uuid));
    if (!plugIn) fail("a fixture plug-in yields no record");
    f.plugIns.push_back(std::move(plugIn));
  }
}

Fixture& fixture() {
  static Fixture* shared = [] {
    ek::log::setSink(std::make_shared<NullSink>());
    ek::log::configure("debug");  // format every log line too
    auto* f = new Fixture;
    f->root = prepareRoot();
    const std::string state =
        temporaryDirectory(f->root.substr(0, f->root.size() - kFixedRoot.size() - 1));
    ::setenv("EKORA_STATE_DIR", state.c_str(), 1);
    ::setenv("EKORA_RUNTIME_DIR", state.c_str(), 1);
    ::setenv("EKORA_SYSTEM_ROOT", (f->root + "/System").c_str(), 1);

    auto codeSigning = std::make_shared<ek::FakeCodeSigning>();
    auto preferences = std::make_shared<ek::prefs::FakePreferences>();
    preferences->set(
        ek::EkDUserPrefs::kDomain, ek::EkDUserPrefs::kExclusionsKey,
        ek::Value(ek::Array{ek::Value(ek::Dictionary{
                                {"ZuExtensionPointIdentifier", ek::Value("com.example.excluded")}}),
                            ek::Value("not a rule")}));
    ek::EkDPlatform platform;
    platform.codeSigning = codeSigning;
    platform.sandbox = f->sandbox;
    platform.registry = f->registry;
    platform.serviceManager = std::make_shared<FuzzServiceManager>();
    platform.notifier = std::make_shared<CountingNotifier>();
    platform.extensions = std::make_shared<ek::EkSandbox>(ek::EkSandboxMemoryKeySource::random());
    platform.preferences = preferences;
    platform.types = std::make_shared<ek::types::TypeSystem>();
    platform.consent = std::make_shared<FixedConsent>();
    f->server = ek::EkDServer::initForService("dispatch-fuzz", state + "/Annotations", platform);
    if (!f->server) fail("no server");
    installPlugIns(*f);

    for (ClientSpec& spec : clientSpecs()) {
      codeSigning->setEntitlements(::getpid(), std::move(spec.entitlements));
      f->clients.push_back(connectClient(*f));
      f->sandboxed.push_back(spec.sandboxed);
    }
    f->server->database().databaseQueue()->sync(
        [&] { f->baselineAnnotations = f->server->database().annotations().annotations(); });
    return f;
  }();
  return *shared;
}

// Reads exactly size bytes from fd before the deadline.
void readFully(int fd, uint8_t* out, size_t size, std::chrono::steady_clock::time_point deadline) {
  while (size > 0) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) fail("the handler did not reply in time");
    pollfd entry{fd, POLLIN, 0};
    int ready = ::poll(&entry, 1, static_cast<int>(left.count()));
    if (ready < 0 && errno == EINTR) continue;
    if (ready < 0) fail("poll failed");
    if (ready == 0) continue;
    ssize_t n = ::recv(fd, out, size, 0);
    if (n < 0 && (errno == EINTR || errno == EAGAIN)) continue;
    if (n <= 0) fail("the connection ended before the reply");
    out += n;
    size -= static_cast<size_t>(n);
  }
}

ek::Value readReply(int fd, uint64_t id) {
  const auto deadline = std::chrono::steady_clock::now() + kReplyTimeout;
  uint8_t header[ek::wyre::kHeaderSize];
  readFully(fd, header, sizeof header, deadline);
  const ek::wyre::FrameHeader frame = ek::wyre::decodeHeader(header);
  if (frame.id != id) fail("a reply to another request (or a second reply) arrived");
  if (!(frame.flags & ek::wyre::kFlagReply)) fail("the daemon sent a message that is no reply");
  if (frame.length > ek::wyre::kMaxBodySize) fail("oversized reply");
  std::vector<uint8_t> body(frame.length);
  readFully(fd, body.data(), body.size(), deadline);
  auto decoded = ek::cbor::decode(body);
  if (!decoded) fail("the reply does not decode");
  return std::move(decoded).value();
}

bool isNumber(const ek::Value& value) {
  return value.unsignedNumber() || value.negativeNumber() || value.doubleNumber();
}

// What every reply, and the successful replies of some requests, must look like.
void checkReply(const ek::Value& request, const ek::Value& reply) {
  const ek::Dictionary* body = reply.dictionary();
  if (!body) fail("the reply is not a dictionary");
  const ek::Value* code = reply.get(ek::protocol::kErrorCode);
  if (code) {
    if (!isNumber(*code)) fail("\"errorcode\" is not a number");
    if (!reply.getString(ek::protocol::kError)) fail("an error code without an \"error\" string");
    return;
  }
  const std::string* type = request.getString(ek::protocol::kRequest);
  const uint64_t* version = request.getUnsigned(ek::protocol::kVersion);
  if (!type) fail("a request without a type succeeded");
  if (!version ||
      (*version != ek::protocol::kCurrentVersion && *version != ek::protocol::kOldestVersion)) {
    fail("a request of an unsupported version succeeded");
  }
  const bool current = *version == ek::protocol::kCurrentVersion;
  if (*type == ek::protocol::kMatch && current && !reply.getArray(ek::protocol::kMatches)) {
    fail("a successful match without \"matches\"");
  }
  if (*type == ek::protocol::kFind && current && !reply.getDictionary(ek::protocol::kMatches)) {
    fail("a successful find without its form");
  }
  if (*type == ek::protocol::kAccess) {
    const ek::Array* tokens = reply.getArray(ek::protocol::kExtensions);
    const ek::Array* uuids = request.getArray(ek::protocol::kUuids);
    if (!tokens || !uuids || tokens->size() != uuids->size()) {
      fail("a successful access without one extension per plug-in");
    }
  }
  if (*type == ek::protocol::kLock && !request.getArray(ek::protocol::kUuids)) {
    const ek::Value* token = reply.get(ek::protocol::kUuids);
    if (!token || !token->uuid()) fail("a granted hold without its token");
  }
}

// Puts the stored annotations back as they were before the input.
void restoreAnnotations(Fixture& f) {
  f.server->database().databaseQueue()->sync([&] {
    ek::EkDAnnotationStore& store = f.server->database().annotations();
    if (store.annotations() == f.baselineAnnotations) return;
    store.deferSaves();
    std::vector<std::string> keys;
    for (const auto& [key, value] : store.annotations()) keys.push_back(key);
    bool restored = true;
    for (const std::string& key : keys) restored &= store.setAnnotation(std::nullopt, key).ok();
    for (const auto& [key, value] : f.baselineAnnotations) {
      if (const ek::Dictionary* annotation = value.dictionary())
        restored &= store.setAnnotation(*annotation, key).ok();
    }
    restored &= store.saveDeferred().ok();
    if (!restored) fail("the stored annotations could not be put back");
  });
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  Fixture& f = fixture();
  ek::Result<ek::Value> decoded = ek::cbor::decode(std::span<const uint8_t>(data, size));
  if (!decoded.ok()) return 0;

  size_t index = 0;
  if (const uint64_t* chosen = decoded->getUnsigned(kClientKey)) index = *chosen % f.clients.size();
  const std::shared_ptr<ek::EkDWyreClient>& client = f.clients[index];
  f.sandbox->setSandboxed(::getpid(), f.sandboxed[index]);

  ek::wyre::Message message;
  message.body = *decoded;
  message.id = f.nextId++;
  message.flags = ek::wyre::kFlagWantsReply;
  auto transaction = ek::Transaction::initWithRequest(std::move(message), client);
  f.server->submitWork([transaction] {
    transaction->client()->countRequest();
    transaction->dispatch();
  });
  const ek::Value reply = readReply(f.peers[index], f.nextId - 1);
  if (f.verbose) std::fprintf(stderr, "reply: %s\n", reply.description().c_str());
  checkReply(*decoded, reply);

  // The handler has returned once the work queue runs the next block; by then nothing else may
  // have been sent.
  onWorkQueue(f, [] {});
  uint8_t extra;
  if (::recv(f.peers[index], &extra, 1, MSG_DONTWAIT | MSG_PEEK) != -1 || errno != EAGAIN) {
    fail("more than one reply");
  }

  f.server->unholdClient(client);
  restoreAnnotations(f);
  return 0;
}
