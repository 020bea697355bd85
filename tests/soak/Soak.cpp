// ekora_soak: the whole daemon under sustained mixed load and chaos for a bounded time, then
// checks that nothing it promised was lost or leaked.
//
//   ekora_soak [--duration SECONDS] [--seed N]
//
// ekbench sends every request type from 32 connections while a chaos driver kills clients in
// the middle of requests (holding Notes, with a service declared, with requests outstanding),
// installs and uninstalls bundles, sends malformed frames, keeps a connection that never reads
// its replies, and kills ekd with SIGKILL a few times. An annotator writes increasing counters to
// a few plug-ins throughout. After the last kill the run warms up, records ekd's RSS and
// descriptors with no client connected, runs the rest of the traffic and records them again.
// The duration (default 600 s, or $EKORA_SOAK_SECONDS) is the traffic time.
//
// Run as `ekora_soak --client SOCKET PATH UUID` it is one of the clients the chaos driver kills.

#include <fcntl.h>
#include <fmt/format.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>
#include <nlohmann/json.hpp>
#include <random>
#include <set>
#include <sstream>
#include <thread>

#include "platform/cbor/Cbor.h"
#include "platform/dmap/Dmap.h"
#include "platform/json/WireJson.h"
#include "platform/wyre/Wyre.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

extern char** environ;

namespace ek::soak {
namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;
using std::chrono::seconds;
using test::request;

constexpr unsigned kBenchPlugIns = 200;
// The annotator's plug-ins: bench plug-ins P0 .. P(kAnnotated - 1). ekbench never touches them.
constexpr unsigned kAnnotated = 8;
constexpr double kRssTolerance = 0.10;
constexpr const char* kManager = "com.corvane.private.ekora.manager";
// Every wait on the daemon is bounded, so a dead or wedged ekd fails the run.
constexpr milliseconds kTimeout = seconds(30);

void sleepMs(int ms) {
  std::this_thread::sleep_for(milliseconds(ms));
}

// Problems found by any thread; the run fails when there is one.
class Problems {
 public:
  void add(const std::string& what) {
    std::lock_guard lock(mutex_);
    if (list_.size() < 50) list_.push_back(what);
  }
  std::vector<std::string> list() const {
    std::lock_guard lock(mutex_);
    return list_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> list_;
};

// A program run beside the soak with the daemon's environment, its output in a file. Killed and
// reaped by its destructor at the latest, so none outlives the run.
class Child {
 public:
  Child(const std::vector<std::string>& argv, fs::path out) : out_(std::move(out)) {
    std::vector<char*> args;
    for (const std::string& arg : argv) args.push_back(const_cast<char*>(arg.c_str()));
    args.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 1, out_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_WRONLY, 0);
    if (posix_spawn(&pid_, args[0], &actions, nullptr, args.data(), environ) != 0) pid_ = -1;
    posix_spawn_file_actions_destroy(&actions);
  }
  ~Child() {
    if (!status_) kill9();
    std::error_code ignored;
    fs::remove(out_, ignored);
  }
  pid_t pid() const { return pid_; }
  std::string output() const {
    std::stringstream text;
    text << std::ifstream(out_).rdbuf();
    return text.str();
  }
  // The first output line starting with prefix, waiting at most timeout for it.
  std::optional<std::string> waitForLine(const std::string& prefix, milliseconds timeout) {
    for (auto end = Clock::now() + timeout; pid_ > 0 && Clock::now() < end; sleepMs(10)) {
      std::istringstream lines(output());
      for (std::string line; std::getline(lines, line);) {
        if (line.starts_with(prefix) && !lines.eof()) return line;
      }
    }
    return std::nullopt;
  }
  // The exit status (128 + signal) once it ended, waiting at most timeout.
  std::optional<int> wait(milliseconds timeout) {
    for (auto end = Clock::now() + timeout; !status_ && pid_ > 0; sleepMs(20)) {
      int status = 0;
      if (waitpid(pid_, &status, Clock::now() < end ? WNOHANG : 0) == pid_) {
        status_ = WIFSIGNALED(status) ? 128 + WTERMSIG(status) : WEXITSTATUS(status);
      } else if (Clock::now() >= end) {
        break;
      }
    }
    return status_;
  }
  void kill9() {
    if (pid_ <= 0 || status_) return;
    ::kill(pid_, SIGKILL);
    wait(kTimeout);
  }

 private:
  fs::path out_;
  pid_t pid_ = -1;
  std::optional<int> status_;
};

bool processAlive(pid_t pid) {
  std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
  std::string text;
  if (!std::getline(stat, text)) return false;
  size_t paren = text.rfind(')');
  return paren != std::string::npos && paren + 2 < text.size() && text[paren + 2] != 'Z';
}

std::map<int, std::string> descriptors(pid_t pid) {
  std::map<int, std::string> out;
  std::error_code error;
  for (const auto& entry : fs::directory_iterator(fmt::format("/proc/{}/fd", pid), error)) {
    out[std::stoi(entry.path().filename())] = fs::read_symlink(entry.path(), error).string();
  }
  return out;
}

void writeDmap(const fs::path& path, const Dictionary& dictionary) {
  fs::create_directories(path.parent_path());
  if (!dmap::writeFileAtomically(path.string(), Value(dictionary), 0644).ok()) std::abort();
}

// An application bundle with two plug-ins on the share point.
void writeApp(const fs::path& bundle, const std::string& identifier) {
  writeDmap(bundle / "Info.dmap", {{"QvBundleIdentifier", identifier}});
  for (const char* plugIn : {"One", "Two"}) {
    Dictionary extension{{"ZuExtensionPointIdentifier", "com.corvane.share"},
                         {"ZuExtensionAttributes", Dictionary{{"ZuExtensionVersion", "1.0"}}}};
    writeDmap(bundle / "PlugIns" / (std::string(plugIn) + ".appex") / "Info.dmap",
              {{"QvBundleIdentifier", identifier + "." + plugIn}, {"ZuExtension", extension}});
  }
}

Value uuids(std::initializer_list<Uuid> list) {
  return Value(Array(list.begin(), list.end()));
}

struct World {
  fs::path root;  // canonical root of the daemon's directories
  std::string notes, churn, ekctl, ekbench, requests;
  std::vector<Uuid> bench;               // by index i: System/Library/PlugIns/P<i>.bundle
  Uuid viewerShare, thumbs, notesShare;  // Notes is held by killed clients
  std::atomic<unsigned> outputs{0};
  fs::path output() { return root / fmt::format("out-{}", outputs++); }
};

// The request lines ekbench cycles through: every request type, weighted towards the common
// ones. No hold outlives its request and nothing touches the annotator's plug-ins.
std::vector<Value> benchRequests(const World& w, std::mt19937_64& random) {
  std::vector<Value> out;
  auto bench = [&](unsigned salt) {
    return w.bench[kAnnotated + salt % (kBenchPlugIns - kAnnotated)];
  };
  for (unsigned i = 0; i < 24; ++i) {
    out.push_back(request("find", {{"uuids", bench(i * 7)}}));
    out.push_back(request(
        "match", {{"rules", Dictionary{{"ZuExtensionPointIdentifier",
                                        fmt::format("com.corvane.bench.point{}", 1 + i % 3)}}}}));
  }
  for (unsigned i = 0; i < 8; ++i) {
    out.push_back(request("annotate", {{"annotations", Dictionary{{"election", i % 2}}},
                                       {"uuids", uuids({bench(i), bench(i + 50)})}}));
    out.push_back(
        request("bulk-annotate",
                {{"annotations", Dictionary{{bench(i + 100).string(), Dictionary{{"n", i}}}}}}));
    out.push_back(request("ready", {{"uuids", uuids({w.viewerShare, bench(i + 20)})}}));
    out.push_back(request("access", {{"uuids", uuids({w.thumbs, bench(i + 30)})}}));
    out.push_back(request("bulk", {{"flags", uint64_t{0}}}));
    out.push_back(request("lock", {{"uuids", uuids({Uuid::random()})}}));
  }
  out.push_back(request("add", {{"paths", Array{w.churn}}}));
  out.push_back(request("remove", {{"paths", Array{w.churn}}}));
  out.push_back(request("match", {}));
  std::shuffle(out.begin(), out.end(), random);
  return out;
}

// Writes increasing counters ("extension" {"soak": n}) to its plug-ins over one connection and
// records every value sent and the last one acknowledged per plug-in.
class Annotator {
 public:
  explicit Annotator(const World& world) : sent_(kAnnotated), acked_(kAnnotated, 0) {
    targets_.assign(world.bench.begin(), world.bench.begin() + kAnnotated);
  }
  void start(const std::string& socket) {
    stop_ = false;
    thread_ = std::thread([this, socket] { run(socket); });
  }
  void stop() {
    stop_ = true;
    if (thread_.joinable()) thread_.join();
  }
  uint64_t acknowledged() const { return acknowledged_; }

  // Each stored counter is one that was sent and not older than the last acknowledged (exactly
  // that one when nothing was left unanswered).
  void verify(const test::EkdProcess& daemon, const std::string& when, bool exact,
              Problems& problems) {
    for (unsigned i = 0; i < kAnnotated; ++i) {
      auto reply = daemon.ask(request("find", {{"uuids", Value(targets_[i])}}), kTimeout);
      const Value* counter =
          reply && reply->get("matches") && reply->get("matches")->get("annotations")
              ? reply->get("matches")->get("annotations")->get("extension")
              : nullptr;
      const uint64_t* stored = counter ? counter->getUnsigned("soak") : nullptr;
      if (stored
              ? !sent_[i].count(*stored) || *stored < acked_[i] || (exact && *stored != acked_[i])
              : acked_[i] != 0) {
        problems.add(fmt::format("{}: P{} holds {}, last acknowledged {}", when, i,
                                 stored ? std::to_string(*stored) : "nothing", acked_[i]));
      }
    }
  }

 private:
  void run(const std::string& socket) {
    std::unique_ptr<test::RawClient> client;
    for (uint64_t id = 1; !stop_; ++id) {
      if (!client || !client->connected()) client = std::make_unique<test::RawClient>(socket);
      const unsigned i = id % kAnnotated;
      sent_[i].insert(id);
      auto body =
          request("annotate", {{"annotations", Dictionary{{"extension", Dictionary{{"soak", id}}}}},
                               {"uuids", uuids({targets_[i]})}});
      std::optional<test::RawClient::Frame> reply;
      if (client->sendMessage(body, id)) reply = client->readFrame(kTimeout);
      if (!reply || reply->id != id || test::replyErrorCode(reply->body) != 0) {
        client.reset();
        sleepMs(50);
        continue;
      }
      acked_[i] = id;
      ++acknowledged_;
    }
  }

  std::vector<Uuid> targets_;
  std::vector<std::set<uint64_t>> sent_;
  std::vector<uint64_t> acked_;
  std::atomic<uint64_t> acknowledged_{0};
  std::atomic<bool> stop_{false};
  std::thread thread_;
};

class Chaos {
 public:
  Chaos(test::EkdProcess& daemon, World& world, Problems& problems, uint64_t seed)
      : daemon_(daemon), world_(world), problems_(problems), random_(seed) {}

  void start() {
    stop_ = false;
    rounds_ = 0;
    thread_ = std::thread([this] { run(); });
  }
  // Stops after the current action; with wholeRound not before every action ran once.
  void stop(bool wholeRound = false) {
    for (auto end = Clock::now() + seconds(120); wholeRound && rounds_ == 0 && Clock::now() < end;)
      sleepMs(50);
    stop_ = true;
    if (thread_.joinable()) thread_.join();
  }
  void uninstallAll() {
    while (!installed_.empty()) uninstallOldest();
  }
  // The killed clients that declared a service.
  std::vector<pid_t> deadHosts() const { return deadHosts_; }

 private:
  using Action = void (Chaos::*)();

  void run() {
    std::vector<Action> round{&Chaos::killedClient, &Chaos::killedClient, &Chaos::killedEkctl,
                              &Chaos::killedEkctl,  &Chaos::install,      &Chaos::garbage,
                              &Chaos::garbage};
    while (!stop_) {
      std::shuffle(round.begin(), round.end(), random_);
      for (Action action : round) {
        if (stop_) break;
        topUpNonReader();
        (this->*action)();
        if (installed_.size() > 2) uninstallOldest();
        sleepMs(std::uniform_int_distribution<int>(20, 150)(random_));
      }
      if (!stop_) ++rounds_;
    }
    if (nonReader_ >= 0) ::close(nonReader_);
    nonReader_ = -1;
  }

  // A client that holds Notes, declares Viewer's share service, then sends a burst of requests
  // and is killed before it reads their replies.
  void killedClient() {
    Child child(
        {selfPath(), "--client", daemon_.socketPath(), world_.notes, world_.viewerShare.string()},
        world_.output());
    auto ready = child.waitForLine("ready", kTimeout);
    if (ready != "ready 0 0") problems_.add("raw client: " + ready.value_or("no answer"));
    child.waitForLine("sent", kTimeout);
    sleepMs(std::uniform_int_distribution<int>(0, 5)(random_));
    child.kill9();
    deadHosts_.push_back(child.pid());
  }

  // ekctl killed at a random moment of its request.
  void killedEkctl() {
    const std::vector<std::vector<std::string>> commands{
        {"match", R"({"ZuExtensionPointIdentifier":"com.corvane.bench.point0"})"},
        {"ready", world_.viewerShare.string(), world_.thumbs.string()},
        {"annotate", "--set", R"({"extension":{"ekctl":1}})", world_.bench[kAnnotated].string()},
        {"hold", world_.notes},
        {"add", world_.notes}};
    std::vector<std::string> argv{test::ekctlPath(), "-S", daemon_.service()};
    const auto& command = commands[random_() % commands.size()];
    argv.insert(argv.end(), command.begin(), command.end());
    Child child(argv, world_.output());
    sleepMs(std::uniform_int_distribution<int>(0, 60)(random_));
    child.kill9();
    deadHosts_.push_back(child.pid());
  }

  void install() {
    const std::string identifier = fmt::format("com.test.soak.install{}", nextInstall_);
    const fs::path bundle = world_.root / fmt::format("Applications/Install{}.app", nextInstall_++);
    writeApp(bundle, identifier);
    auto result = daemon_.ekctl({"add", bundle.string()});
    if (result.status != 0) problems_.add(fmt::format("ekctl add failed: {}", result.err));
    installed_.push_back(bundle);
  }
  void uninstallOldest() {
    auto result = daemon_.ekctlAs(world_.ekctl, {"remove", installed_.front().string()});
    if (result.status != 0) problems_.add(fmt::format("ekctl remove failed: {}", result.err));
    fs::remove_all(installed_.front());
    installed_.erase(installed_.begin());
  }

  // A malformed frame on a connection of its own; the daemon must go on serving everyone else.
  void garbage() {
    auto frame = [](uint32_t length, std::vector<uint8_t> body) {
      std::vector<uint8_t> bytes(wyre::kHeaderSize);
      wyre::encodeHeader({length, wyre::kFlagWantsReply, 1}, bytes.data());
      bytes.insert(bytes.end(), body.begin(), body.end());
      return bytes;
    };
    std::vector<uint8_t> find = cbor::encode(request("find", {{"uuids", Value(world_.thumbs)}}));
    std::vector<uint8_t> nested(100000, 0x81);
    const std::vector<std::vector<uint8_t>> frames{
        frame(0xffffffffu, {}),
        frame(wyre::kMaxBodySize + 1, {}),
        frame(64, std::vector<uint8_t>(64, 0xff)),
        frame(static_cast<uint32_t>(find.size()), {}),
        frame(static_cast<uint32_t>(find.size() / 2),
              {find.begin(), find.begin() + find.size() / 2}),
        frame(static_cast<uint32_t>(nested.size()), nested),
        frame(0, {})};
    {
      test::RawClient client(daemon_.socketPath());
      client.sendBytes(frames[nextGarbage_++ % frames.size()]);
      client.readFrame(milliseconds(std::uniform_int_distribution<int>(0, 200)(random_)));
    }
    if (!daemon_.ask(request("bulk"), kTimeout))
      problems_.add("ekd stopped answering after garbage");
  }

  // A connection that sends requests with large replies and never reads them.
  void topUpNonReader() {
    if (nonReader_ < 0) {
      nonReader_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
      sockaddr_un address{};
      address.sun_family = AF_UNIX;
      std::strncpy(address.sun_path, daemon_.socketPath().c_str(), sizeof address.sun_path - 1);
      if (connect(nonReader_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
        ::close(nonReader_);
        nonReader_ = -1;
        return;
      }
      pending_.clear();
    }
    for (int i = 0; i < 16; ++i) {
      if (pending_.empty()) wyre::appendFrame(pending_, request("match"), wyre::kFlagWantsReply, 1);
      ssize_t n = send(nonReader_, pending_.data(), pending_.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
      if (n < 0) {
        if (errno == EAGAIN) return;  // the daemon stopped reading it
        ::close(nonReader_);          // the daemon hung up on it
        nonReader_ = -1;
        return;
      }
      pending_.erase(pending_.begin(), pending_.begin() + n);
    }
  }

  static std::string selfPath() { return fs::read_symlink("/proc/self/exe").string(); }

  test::EkdProcess& daemon_;
  World& world_;
  Problems& problems_;
  std::mt19937_64 random_;
  std::atomic<bool> stop_{false};
  std::atomic<unsigned> rounds_{0};
  std::thread thread_;
  std::vector<pid_t> deadHosts_;
  std::vector<fs::path> installed_;
  unsigned nextInstall_ = 0, nextGarbage_ = 0;
  int nonReader_ = -1;
  std::vector<uint8_t> pending_;
};

class Soak {
 public:
  Soak(double seconds, uint64_t seed) : seconds_(seconds), seed_(seed), random_(seed) {}
  int run();

 private:
  bool setUp();
  std::optional<Uuid> uuidOf(const std::string& path);
  void finishBench(Child& bench, double duration);
  void checkFiles(const std::string& when);
  void checkEverythingListed(const std::string& when);
  size_t settledDescriptors();
  long settledRss();
  bool running() { return daemon_.running() && processAlive(daemon_.pid()); }
  std::unique_ptr<Child> startBench(double duration) {
    return std::make_unique<Child>(
        std::vector<std::string>{world_.ekbench, "-S", daemon_.service(), "--connections", "32",
                                 "--duration", fmt::format("{:.3f}", duration), "--warmup", "0",
                                 "--timeout", "30", "--requests", world_.requests, "--json"},
        world_.output());
  }
  // Starts the traffic of one lifetime of the daemon.
  void startTraffic(Annotator& annotator, Chaos& chaos) {
    annotator.start(daemon_.socketPath());
    chaos.start();
  }

  double seconds_;
  uint64_t seed_;
  std::mt19937_64 random_;
  test::EkdProcess daemon_;
  World world_;
  Problems problems_;
};

std::optional<Uuid> Soak::uuidOf(const std::string& path) {
  auto reply = daemon_.ask(request("find", {{"paths", Value("file://" + path)}}), kTimeout);
  const std::string* uuid =
      reply && reply->get("matches") ? reply->get("matches")->getString("uuid") : nullptr;
  if (!uuid) problems_.add("no plug-in found at " + path);
  return uuid ? Uuid::parse(*uuid) : std::nullopt;
}

bool Soak::setUp() {
  world_.root = fs::canonical(daemon_.root().path());
  daemon_.setEnvironment("EKORA_LOG", "default");
  daemon_.exportEnvironment();  // for every child started later
  auto fixture = test::runCommand({BENCH_FIXTURE_PATH, "plugins", "--system-root",
                                   (world_.root / "System").string(), "--count",
                                   std::to_string(kBenchPlugIns), "--points", "4"});
  fs::create_directories(world_.root / "Applications");
  for (const char* app : {"Viewer.app", "Notes.app"}) {
    fs::copy(fs::path(EXAMPLES_DIR) / "Applications" / app, world_.root / "Applications" / app,
             fs::copy_options::recursive);
  }
  const std::string viewer = (world_.root / "Applications/Viewer.app").string();
  world_.notes = (world_.root / "Applications/Notes.app").string();
  world_.churn = (world_.root / "Applications/Churn.app").string();
  writeApp(world_.churn, "com.test.soak.churn");
  // Copies with the manager's entitlement, so that their removals are served.
  world_.ekctl = test::ekctlWithEntitlements(world_.root / "bin", {kManager});
  world_.ekbench = (world_.root / "bin/ekbench").string();
  fs::copy_file(EKBENCH_PATH, world_.ekbench);
  writeDmap(world_.ekbench + ".entitlements", {{kManager, true}});
  if (fixture.status != 0 || !daemon_.start()) {
    problems_.add("set-up failed: " + fixture.err + daemon_.log());
    return false;
  }
  auto added =
      daemon_.ask(request("add", {{"paths", Array{viewer, world_.notes, world_.churn}}}), kTimeout);
  if (!added || test::replyErrorCode(*added) != 0) return problems_.add("adding failed"), false;
  for (unsigned i = 0; i < kBenchPlugIns; ++i) {
    auto uuid =
        uuidOf(fmt::format("{}/System/Library/PlugIns/P{}.bundle", world_.root.string(), i));
    if (!uuid) return false;
    world_.bench.push_back(*uuid);
  }
  auto share = uuidOf(viewer + "/PlugIns/Share.appex");
  auto thumbs = uuidOf(viewer + "/PlugIns/Thumbs.appex");
  auto notesShare = uuidOf(world_.notes + "/PlugIns/Share.appex");
  if (!share || !thumbs || !notesShare) return false;
  world_.notesShare = *notesShare;
  world_.viewerShare = *share;
  world_.thumbs = *thumbs;
  world_.requests = (world_.root / "requests.jsonl").string();
  std::ofstream requests(world_.requests);
  for (const Value& message : benchRequests(world_, random_))
    requests << wirejson::write(message) << "\n";
  return static_cast<bool>(requests.flush());
}

// No client is lost while ekd runs: ekbench ends in time with every request answered.
void Soak::finishBench(Child& bench, double duration) {
  auto status = bench.wait(milliseconds(static_cast<int64_t>(duration * 1000)) + seconds(90));
  auto report = nlohmann::json::parse(bench.output(), nullptr, false);
  if (!status || report.is_discarded() || !report.contains("daemon")) {
    return problems_.add("ekbench ended without a report: " + bench.output());
  }
  const auto& daemon = report["daemon"];
  if (*status != 0 || daemon.value("requests", 0) == 0 || daemon.value("failures", 0) != 0) {
    problems_.add(fmt::format("ekbench (status {}) lost clients with ekd running: {}", *status,
                              daemon.dump()));
  }
}

// Nothing was set aside or found broken, and no declaration outlived its host.
void Soak::checkFiles(const std::string& when) {
  std::ifstream log(daemon_.root().path() / "ekd.log");
  for (std::string line; std::getline(log, line);) {
    for (const char* bad : {"(resetting)", "moved aside", "kept unusable", "runtime error:"}) {
      if (line.find(bad) != std::string::npos) problems_.add(when + ": ekd logged: " + line);
    }
  }
  std::error_code error;
  for (const auto& entry : fs::directory_iterator(world_.root / "state", error)) {
    const std::string name = entry.path().filename();
    if (name.find(".corrupt-") != std::string::npos || name.find(".bad-") != std::string::npos) {
      problems_.add(when + ": a state file was set aside: " + name);
    }
  }
  for (const auto& entry : fs::directory_iterator(world_.root / "run/services", error)) {
    const std::string name = entry.path().filename();
    if (std::all_of(name.begin(), name.end(), ::isdigit) && !processAlive(std::stoi(name))) {
      problems_.add(when + ": declarations of exited host " + name + " remain");
    }
  }
}

// The registry keeps every plug-in with its UUID, nothing is left held or installed.
void Soak::checkEverythingListed(const std::string& when) {
  auto reply = daemon_.ask(request("match", {}), kTimeout);
  std::set<std::string> listed;
  for (const Value& form :
       reply && reply->getArray("matches") ? *reply->getArray("matches") : Array{}) {
    if (const std::string* uuid = form.getString("uuid")) listed.insert(*uuid);
    if (const std::string* id = form.getString("identifier");
        id && id->starts_with("com.test.soak.install")) {
      problems_.add(when + ": uninstalled " + *id + " is listed");
    }
  }
  std::vector<Uuid> expected = world_.bench;
  expected.insert(expected.end(), {world_.viewerShare, world_.thumbs, world_.notesShare});
  for (const Uuid& uuid : expected) {
    if (!listed.count(uuid.string())) problems_.add(when + ": " + uuid.string() + " is not listed");
  }
}

// The descriptor count once it has stayed the same for a second: closing a connection reaches
// the daemon asynchronously.
size_t Soak::settledDescriptors() {
  size_t last = descriptors(daemon_.pid()).size();
  for (auto end = Clock::now() + seconds(20), since = Clock::now();
       Clock::now() < end && Clock::now() - since < seconds(1); sleepMs(100)) {
    if (size_t now = descriptors(daemon_.pid()).size(); now != last)
      last = now, since = Clock::now();
  }
  return last;
}

// The same for the RSS: an idle daemon gives freed heap back shortly after its last request.
long Soak::settledRss() {
  long last = test::residentKiB(daemon_.pid());
  for (auto end = Clock::now() + seconds(20), since = Clock::now();
       Clock::now() < end && Clock::now() - since < seconds(1); sleepMs(100)) {
    if (long now = test::residentKiB(daemon_.pid()); now != last) last = now, since = Clock::now();
  }
  return last;
}

int Soak::run() {
  // Kill phases first, then the last lifetime of the daemon, whose first third warms it up
  // before its RSS and descriptors are recorded.
  const unsigned killPhases = std::clamp(static_cast<unsigned>(seconds_ / 60), 2u, 10u);
  const double last = std::max(8.0, seconds_ * 0.45);
  const double warmup = std::max(4.0, last / 3);
  const double killPhase = std::max(2.0, (seconds_ - last) / killPhases);
  const auto started = Clock::now();
  if (!setUp()) {
    for (const std::string& problem : problems_.list()) fmt::print("  problem: {}\n", problem);
    return 1;
  }
  Annotator annotator(world_);
  Chaos chaos(daemon_, world_, problems_, random_());
  for (unsigned phase = 1; phase <= killPhases && problems_.list().empty(); ++phase) {
    auto bench = startBench(killPhase + 120);
    startTraffic(annotator, chaos);
    for (auto end = Clock::now() + milliseconds(static_cast<int64_t>(killPhase * 1000));
         Clock::now() < end && running();)
      sleepMs(50);
    chaos.stop();
    if (!running()) problems_.add(fmt::format("ekd died by itself in phase {}", phase));
    sleepMs(std::uniform_int_distribution<int>(0, 300)(random_));
    daemon_.kill9();
    annotator.stop();
    bench.reset();
    if (!daemon_.start()) problems_.add("ekd did not start after SIGKILL: " + daemon_.log());
    const std::string when = fmt::format("after SIGKILL {}", phase);
    annotator.verify(daemon_, when, false, problems_);
    checkFiles(when);
  }
  size_t fdsBefore = 0, fdsAfter = 0;
  long rssBefore = 0, rssAfter = 0;
  for (double duration : {warmup, last - warmup}) {
    if (!problems_.list().empty()) break;
    if (fdsBefore == 0 && duration != warmup)
      fdsBefore = settledDescriptors(), rssBefore = settledRss();
    auto bench = startBench(duration);
    startTraffic(annotator, chaos);
    finishBench(*bench, duration);
    chaos.stop(true);
    annotator.stop();
    if (!running()) problems_.add("ekd died during the last lifetime");
  }
  if (problems_.list().empty()) {
    chaos.uninstallAll();
    // All clients are gone: the daemon must be back where the warm-up left it.
    for (auto end = Clock::now() + seconds(20);
         descriptors(daemon_.pid()).size() != fdsBefore && Clock::now() < end;)
      sleepMs(100);
    fdsAfter = settledDescriptors();
    rssAfter = settledRss();
    if (fdsAfter != fdsBefore)
      problems_.add(fmt::format("ekd leaked descriptors: {} -> {}", fdsBefore, fdsAfter));
    if (!test::kSanitized && rssAfter > rssBefore * (1 + kRssTolerance)) {
      problems_.add(fmt::format("ekd's RSS grew from {} KiB to {} KiB", rssBefore, rssAfter));
    }
    // A declaration written now prunes those of hosts that exited.
    auto ready = daemon_.ask(request("ready", {{"uuids", uuids({world_.viewerShare})}}), kTimeout);
    if (!ready || test::replyErrorCode(*ready) != 0) problems_.add("the final ready failed");
    for (pid_t pid : chaos.deadHosts()) {
      if (fs::exists(world_.root / "run/services" / std::to_string(pid))) {
        problems_.add(fmt::format("declarations of killed client {} remain", pid));
      }
    }
    checkEverythingListed("at the end");
    annotator.verify(daemon_, "at the end", true, problems_);
    if (annotator.acknowledged() == 0) problems_.add("no annotation was acknowledged");
    // The files load again after a clean stop.
    if (int status = daemon_.terminate(); status != 0)
      problems_.add(fmt::format("ekd exited with {}", status));
    if (!daemon_.start()) problems_.add("ekd did not start again: " + daemon_.log());
    annotator.verify(daemon_, "after the last restart", true, problems_);
    checkEverythingListed("after the last restart");
    checkFiles("after the last restart");
  }
  const auto problems = problems_.list();
  fmt::print(
      "soak: {} in {:.0f} s (seed {}): {} annotations acknowledged, rss_kib={}->{} fds={}->{}\n",
      problems.empty() ? "PASS" : "FAIL",
      std::chrono::duration<double>(Clock::now() - started).count(), seed_,
      annotator.acknowledged(), rssBefore, rssAfter, fdsBefore, fdsAfter);
  for (const std::string& problem : problems) fmt::print("  problem: {}\n", problem);
  return problems.empty() ? 0 : 1;
}

// The client the chaos driver kills: holds a path, declares a service, then sends a burst of
// requests without reading the replies and waits (bounded) to be killed.
int clientMode(char** argv) {
  test::RawClient client(argv[2]);
  auto code = [&](const Value& message, uint64_t id) {
    auto reply = client.sendMessage(message, id) ? client.readFrame(kTimeout) : std::nullopt;
    return reply ? std::to_string(test::replyErrorCode(reply->body)) : "none";
  };
  const Uuid uuid = Uuid::parse(argv[4]).value();
  const std::string held = code(request("lock", {{"paths", Array{argv[3]}}}), 1);
  fmt::print("ready {} {}\n", held, code(request("ready", {{"uuids", uuids({uuid})}}), 2));
  for (uint64_t id = 3; id < 40; ++id) {
    client.sendMessage(id % 2 ? request("match") : request("access", {{"uuids", uuids({uuid})}}),
                       id);
  }
  fmt::print("sent\n");
  std::fflush(stdout);
  std::this_thread::sleep_for(seconds(120));
  return 0;
}

}  // namespace
}  // namespace ek::soak

int main(int argc, char** argv) {
  if (argc == 5 && std::strcmp(argv[1], "--client") == 0) return ek::soak::clientMode(argv);
  ::signal(SIGPIPE, SIG_IGN);
  const char* env = std::getenv("EKORA_SOAK_SECONDS");
  double seconds = env ? std::atof(env) : 600;
  uint64_t seed = std::random_device()();
  for (int i = 1; i + 1 < argc; i += 2) {
    if (std::strcmp(argv[i], "--duration") == 0) seconds = std::atof(argv[i + 1]);
    if (std::strcmp(argv[i], "--seed") == 0) seed = std::strtoull(argv[i + 1], nullptr, 10);
  }
  if (argc % 2 == 0 || !(seconds >= 10 && seconds <= 24 * 3600)) {
    std::fprintf(stderr, "usage: ekora_soak [--duration SECONDS (10 to 86400)] [--seed N]\n");
    return 2;
  }
  return ek::soak::Soak(seconds, seed).run();
}
