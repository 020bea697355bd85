// ekora_soak: the whole daemon under sustained mixed load and chaos for a bounded time, then
// checks that nothing it promised was lost or leaked.
//
//   ekora_soak [--duration SECONDS] [--seed N]
//
// ekbench sends every request type from 32 connections while a chaos driver kills clients in
// the middle of requests (holding Notes, with a service declared, with replies unread),
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

bool processAlive(pid_t pid) {
  std::ifstream stat(fmt::format("/proc/{}/stat", pid));
  std::string text;
  std::getline(stat, text);
  const size_t paren = text.rfind(')');
  return paren != std::string::npos && paren + 2 < text.size() && text[paren + 2] != 'Z';
}

size_t descriptorCount(pid_t pid) {
  std::error_code error;
  fs::directory_iterator fds(fmt::format("/proc/{}/fd", pid), error);
  return static_cast<size_t>(std::distance(fds, fs::directory_iterator()));
}

void writeDmap(const fs::path& path, const Dictionary& dictionary) {
  fs::create_directories(path.parent_path());
  if (!dmap::writeFileAtomically(path.string(), Value(dictionary), 0644).ok()) std::abort();
}

// An application bundle with two plug-ins on the share point.
void writeApp(const fs::path& bundle, const std::string& identifier) {
  writeDmap(bundle / "Info.dmap", {{"QvBundleIdentifier", identifier}});
  for (const std::string plugIn : {"One", "Two"}) {
    writeDmap(bundle / "PlugIns" / (plugIn + ".appex/Info.dmap"),
              {{"QvBundleIdentifier", identifier + "." + plugIn},
               {"ZuExtension", Dictionary{{"ZuExtensionPointIdentifier", "com.corvane.share"},
                                          {"ZuExtensionAttributes", Dictionary{}}}}});
  }
}

Value uuids(std::initializer_list<Uuid> list) {
  return Value(Array(list.begin(), list.end()));
}

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
    if (posix_spawn(&pid_, args[0], &actions, nullptr, args.data(), environ) != 0) status_ = 127;
    posix_spawn_file_actions_destroy(&actions);
  }
  ~Child() {
    kill9();
    std::error_code ignored;
    fs::remove(out_, ignored);
  }
  pid_t pid() const { return pid_; }
  std::string output() const {
    std::stringstream text;
    text << std::ifstream(out_).rdbuf();
    return text.str();
  }
  // Whether the child printed the line within the timeout.
  bool printed(const std::string& line, milliseconds timeout) const {
    for (auto end = Clock::now() + timeout; Clock::now() < end; sleepMs(10)) {
      if (("\n" + output()).find("\n" + line + "\n") != std::string::npos) return true;
    }
    return false;
  }
  // The exit status (128 + signal) once the child ended within the timeout.
  std::optional<int> wait(milliseconds timeout) {
    for (auto end = Clock::now() + timeout; !status_ && Clock::now() < end; sleepMs(20)) {
      int status = 0;
      if (waitpid(pid_, &status, WNOHANG) != pid_) continue;
      status_ = WIFSIGNALED(status) ? 128 + WTERMSIG(status) : WEXITSTATUS(status);
    }
    return status_;
  }
  void kill9() {
    if (status_) return;
    ::kill(pid_, SIGKILL);
    wait(kTimeout);
  }

 private:
  fs::path out_;
  pid_t pid_ = -1;
  std::optional<int> status_;
};

// The daemon, the world its traffic runs on, and the problems found by any thread.
struct Soak {
  test::EkdProcess daemon;
  fs::path root;  // canonical root of the daemon's directories
  std::string notes, churn, ekctl, ekbench, requests;
  std::vector<Uuid> bench;               // by index i: System/Library/PlugIns/P<i>.bundle
  Uuid viewerShare, thumbs, notesShare;  // Notes is held by the killed clients
  std::mt19937_64 random;
  std::atomic<unsigned> outputs{0};
  std::mutex mutex;
  std::vector<std::string> problems;

  void problem(const std::string& what) {
    std::lock_guard lock(mutex);
    problems.push_back(what);
  }
  bool failed() {
    std::lock_guard lock(mutex);
    return !problems.empty();
  }
  fs::path output() { return root / fmt::format("out-{}", outputs++); }
  std::optional<Value> ask(const Value& message) const { return daemon.ask(message, kTimeout); }
  bool setUp();
  std::optional<Uuid> uuidOf(const std::string& path);
  void finishBench(Child& bench, double duration);
  void checkFiles(const std::string& when);
  void checkListed(const std::string& when);
  int run(double duration);
};

// Writes increasing counters ("extension" {"soak": n}) to its plug-ins over one connection and
// records every value sent and the last one acknowledged for each plug-in.
class Annotator {
 public:
  explicit Annotator(Soak& soak) : soak_(soak) {}
  void start() {
    stop_ = false;
    thread_ = std::thread([this] { run(); });
  }
  void stop() {
    stop_ = true;
    if (thread_.joinable()) thread_.join();
  }
  uint64_t acknowledged() const { return acknowledged_; }

  // Each counter stored is one that was sent and no older than the last acknowledged: exactly
  // that one when nothing was left unanswered.
  void verify(const std::string& when, bool exact) {
    for (unsigned i = 0; i < kAnnotated; ++i) {
      auto reply = soak_.ask(request("find", {{"uuids", Value(soak_.bench[i])}}));
      const Value* form = reply ? reply->get("matches") : nullptr;
      const Value* annotations = form ? form->get("annotations") : nullptr;
      const Value* extension = annotations ? annotations->get("extension") : nullptr;
      const uint64_t* stored = extension ? extension->getUnsigned("soak") : nullptr;
      if (stored
              ? !sent_[i].count(*stored) || *stored < acked_[i] || (exact && *stored != acked_[i])
              : acked_[i] != 0) {
        soak_.problem(fmt::format("{}: P{} holds {}, last acknowledged {}", when, i,
                                  stored ? *stored : 0, acked_[i]));
      }
    }
  }

 private:
  void run() {
    std::unique_ptr<test::RawClient> client;
    for (uint64_t id = 1; !stop_; ++id) {
      if (!client) client = std::make_unique<test::RawClient>(soak_.daemon.socketPath());
      const unsigned i = id % kAnnotated;
      sent_[i].insert(id);
      const Value body =
          request("annotate", {{"annotations", Dictionary{{"extension", Dictionary{{"soak", id}}}}},
                               {"uuids", uuids({soak_.bench[i]})}});
      auto reply = client->sendMessage(body, id) ? client->readFrame(kTimeout) : std::nullopt;
      if (reply && reply->id == id && test::replyErrorCode(reply->body) == 0) {
        acked_[i] = id;
        ++acknowledged_;
      } else {
        client.reset();  // ekd is being killed, or restarts
        sleepMs(50);
      }
    }
  }

  Soak& soak_;
  std::set<uint64_t> sent_[kAnnotated];
  uint64_t acked_[kAnnotated] = {};
  std::atomic<uint64_t> acknowledged_{0};
  std::atomic<bool> stop_{false};
  std::thread thread_;
};

// Kills clients in the middle of their requests, installs and uninstalls bundles, sends
// malformed frames and keeps a connection that never reads its replies.
class Chaos {
 public:
  explicit Chaos(Soak& soak) : soak_(soak), random_(soak.random()) {}
  void start() {
    stop_ = false;
    rounds_ = 0;
    thread_ = std::thread([this] { run(); });
  }
  // Stops after the current action; with wholeRound not before every action ran once.
  void stop(bool wholeRound = false) {
    for (auto end = Clock::now() + seconds(120); wholeRound && !rounds_ && Clock::now() < end;) {
      sleepMs(50);
    }
    stop_ = true;
    if (thread_.joinable()) thread_.join();
  }
  void uninstallAll() {
    while (!installed_.empty()) uninstallOldest();
  }
  std::vector<pid_t> deadHosts;  // the killed clients that may have declared a service

 private:
  void run() {
    for (unsigned action = 0; !stop_; ++action) {
      topUpNonReader();
      switch (action % 4) {
        case 0:
          killedClient();
          break;
        case 1:
          killedEkctl();
          break;
        case 2:
          install();
          break;
        default:
          garbage();
          ++rounds_;
      }
      if (installed_.size() > 2) uninstallOldest();
      sleepMs(std::uniform_int_distribution<int>(20, 150)(random_));
    }
    if (nonReader_ >= 0) ::close(nonReader_);
    nonReader_ = -1;
  }

  // Holds Notes, declares Viewer's share service, sends a burst and is killed before it reads
  // the replies.
  void killedClient() {
    Child child({fs::read_symlink("/proc/self/exe"), "--client", soak_.daemon.socketPath(),
                 soak_.notes, soak_.viewerShare.string()},
                soak_.output());
    if (!child.printed("ready 0 0", kTimeout)) soak_.problem("raw client: " + child.output());
    child.printed("sent", kTimeout);
    sleepMs(std::uniform_int_distribution<int>(0, 5)(random_));
    child.kill9();
    deadHosts.push_back(child.pid());
  }

  void killedEkctl() {
    const std::vector<std::string> commands[] = {
        {"ready", soak_.viewerShare.string(), soak_.thumbs.string()},
        {"annotate", "--set", R"({"extension":{"ekctl":1}})", soak_.bench[kAnnotated].string()},
        {"hold", soak_.notes},
        {"add", soak_.notes}};
    std::vector<std::string> argv{test::ekctlPath(), "-S", soak_.daemon.service()};
    const auto& command = commands[random_() % std::size(commands)];
    argv.insert(argv.end(), command.begin(), command.end());
    Child child(argv, soak_.output());
    sleepMs(std::uniform_int_distribution<int>(0, 60)(random_));
    child.kill9();
    deadHosts.push_back(child.pid());
  }

  void install() {
    const fs::path bundle = soak_.root / fmt::format("Applications/Install{}.app", installs_);
    writeApp(bundle, fmt::format("com.test.soak.install{}", installs_++));
    auto added = soak_.daemon.ekctl({"add", bundle.string()});
    if (added.status != 0) soak_.problem("ekctl add failed: " + added.err);
    installed_.push_back(bundle);
  }
  void uninstallOldest() {
    auto removed = soak_.daemon.ekctlAs(soak_.ekctl, {"remove", installed_.front().string()});
    if (removed.status != 0) soak_.problem("ekctl remove failed: " + removed.err);
    fs::remove_all(installed_.front());
    installed_.erase(installed_.begin());
  }

  // A malformed frame on a connection of its own; ekd must go on serving everyone else.
  void garbage() {
    std::vector<uint8_t> bytes(wyre::kHeaderSize);
    const std::vector<uint8_t> bodies[] = {std::vector<uint8_t>(64, 0xff),
                                           std::vector<uint8_t>(100000, 0x81),
                                           cbor::encode(request("bulk"))};
    const std::vector<uint8_t>& body = bodies[garbage_ % 3];
    const uint32_t length =
        garbage_++ % 2 ? wyre::kMaxBodySize + 1 : static_cast<uint32_t>(body.size() - 1);
    wyre::encodeHeader({length, wyre::kFlagWantsReply, 1}, bytes.data());
    bytes.insert(bytes.end(), body.begin(), body.end());
    {
      test::RawClient client(soak_.daemon.socketPath());
      client.sendBytes(bytes);
      client.readFrame(milliseconds(std::uniform_int_distribution<int>(0, 200)(random_)));
    }
    if (!soak_.ask(request("bulk"))) soak_.problem("ekd stopped answering after garbage");
  }

  void topUpNonReader() {
    if (nonReader_ < 0) {
      nonReader_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
      sockaddr_un address{.sun_family = AF_UNIX};
      std::strncpy(address.sun_path, soak_.daemon.socketPath().c_str(),
                   sizeof address.sun_path - 1);
      connect(nonReader_, reinterpret_cast<sockaddr*>(&address), sizeof address);
      pending_.clear();
    }
    for (int i = 0; i < 16; ++i) {
      if (pending_.empty()) wyre::appendFrame(pending_, request("match"), wyre::kFlagWantsReply, 1);
      const ssize_t n = send(nonReader_, pending_.data(), pending_.size(), MSG_NOSIGNAL);
      if (n < 0 && errno == EAGAIN) return;  // ekd stopped reading it
      if (n < 0) {                           // ekd hung up on it, or is down
        ::close(nonReader_);
        nonReader_ = -1;
        return;
      }
      pending_.erase(pending_.begin(), pending_.begin() + n);
    }
  }

  Soak& soak_;
  std::mt19937_64 random_;
  std::atomic<bool> stop_{false};
  std::atomic<unsigned> rounds_{0};
  std::thread thread_;
  std::vector<fs::path> installed_;
  unsigned installs_ = 0, garbage_ = 0;
  int nonReader_ = -1;
  std::vector<uint8_t> pending_;
};

std::optional<Uuid> Soak::uuidOf(const std::string& path) {
  auto reply = ask(request("find", {{"paths", Value("file://" + path)}}));
  const Value* form = reply ? reply->get("matches") : nullptr;
  const std::string* uuid = form ? form->getString("uuid") : nullptr;
  if (!uuid) problem("no plug-in found at " + path);
  return uuid ? Uuid::parse(*uuid) : std::nullopt;
}

bool Soak::setUp() {
  root = fs::canonical(daemon.root().path());
  daemon.setEnvironment("EKORA_LOG", "default");
  daemon.exportEnvironment();  // for every child started later
  auto fixture =
      test::runCommand({BENCH_FIXTURE_PATH, "plugins", "--system-root", (root / "System").string(),
                        "--count", std::to_string(kBenchPlugIns), "--points", "4"});
  for (const char* app : {"Viewer.app", "Notes.app"}) {
    fs::create_directories(root / "Applications" / app);
    fs::copy(fs::path(EXAMPLES_DIR) / "Applications" / app, root / "Applications" / app,
             fs::copy_options::recursive);
  }
  const std::string viewer = (root / "Applications/Viewer.app").string();
  notes = (root / "Applications/Notes.app").string();
  churn = (root / "Applications/Churn.app").string();
  writeApp(churn, "com.test.soak.churn");
  // Copies with the manager's entitlement, so that their removals are served.
  ekctl = test::ekctlWithEntitlements(root / "bin", {kManager});
  ekbench = (root / "bin/ekbench").string();
  fs::copy_file(EKBENCH_PATH, ekbench);
  writeDmap(ekbench + ".entitlements", {{kManager, true}});
  if (fixture.status != 0 || !daemon.start()) {
    problem("set-up failed: " + fixture.err + daemon.log());
    return false;
  }
  auto added = ask(request("add", {{"paths", Array{viewer, notes, churn}}}));
  if (!added || test::replyErrorCode(*added) != 0) problem("adding the applications failed");
  for (unsigned i = 0; i < kBenchPlugIns; ++i) {
    auto uuid = uuidOf(fmt::format("{}/System/Library/PlugIns/P{}.bundle", root.string(), i));
    bench.push_back(uuid.value_or(Uuid()));
  }
  viewerShare = uuidOf(viewer + "/PlugIns/Share.appex").value_or(Uuid());
  thumbs = uuidOf(viewer + "/PlugIns/Thumbs.appex").value_or(Uuid());
  notesShare = uuidOf(notes + "/PlugIns/Share.appex").value_or(Uuid());

  // The request lines ekbench cycles through: every request type, weighted towards the common
  // ones. No hold outlives its request and nothing touches the annotator's plug-ins.
  std::vector<Value> lines{request("add", {{"paths", Array{churn}}}),
                           request("remove", {{"paths", Array{churn}}}), request("match")};
  auto some = [&](unsigned salt) {
    return bench[kAnnotated + salt % (kBenchPlugIns - kAnnotated)];
  };
  for (unsigned i = 0; i < 24; ++i) {
    const std::string point = fmt::format("com.corvane.bench.point{}", 1 + i % 3);
    lines.push_back(request("find", {{"uuids", some(i * 7)}}));
    lines.push_back(
        request("match", {{"rules", Dictionary{{"ZuExtensionPointIdentifier", point}}}}));
    if (i % 3) continue;
    lines.push_back(request("annotate", {{"annotations", Dictionary{{"election", i % 2}}},
                                         {"uuids", uuids({some(i), some(i + 50)})}}));
    lines.push_back(request(
        "bulk-annotate", {{"annotations", Dictionary{{some(i).string(), Dictionary{{"n", i}}}}}}));
    lines.push_back(request("ready", {{"uuids", uuids({viewerShare, some(i + 20)})}}));
    lines.push_back(request("access", {{"uuids", uuids({thumbs, some(i + 30)})}}));
    lines.push_back(request("bulk", {{"flags", uint64_t{0}}}));
    lines.push_back(request("lock", {{"uuids", uuids({Uuid::random()})}}));
  }
  std::shuffle(lines.begin(), lines.end(), random);
  requests = (root / "requests.jsonl").string();
  std::ofstream out(requests);
  for (const Value& line : lines) out << wirejson::write(line) << "\n";
  return out.flush() && !failed();
}

// No client is lost while ekd runs: ekbench ends in time with every request answered.
void Soak::finishBench(Child& bench, double duration) {
  auto status = bench.wait(milliseconds(static_cast<int64_t>(duration * 1000)) + seconds(90));
  auto report = nlohmann::json::parse(bench.output(), nullptr, false);
  if (!status || report.is_discarded() || !report.contains("daemon")) {
    return problem("ekbench ended without a report: " + bench.output());
  }
  if (*status != 0 || report["daemon"].value("requests", 0) == 0 ||
      report["daemon"].value("failures", 0) != 0) {
    problem(fmt::format("ekbench (status {}) lost clients: {}", *status, report["daemon"].dump()));
  }
}

// Nothing was found broken or set aside, and no declaration outlived its host.
void Soak::checkFiles(const std::string& when) {
  std::ifstream log(daemon.root().path() / "ekd.log");
  for (std::string line; std::getline(log, line);) {
    for (const char* bad : {"(resetting)", "moved aside", "kept unusable", "runtime error:"}) {
      if (line.find(bad) != std::string::npos) problem(when + ": ekd logged: " + line);
    }
  }
  std::error_code error;
  for (const auto& entry : fs::directory_iterator(root / "state", error)) {
    const std::string name = entry.path().filename();
    if (name.find(".corrupt-") != std::string::npos || name.find(".bad-") != std::string::npos) {
      problem(when + ": a state file was set aside: " + name);
    }
  }
  for (const auto& entry : fs::directory_iterator(root / "run/services", error)) {
    const std::string name = entry.path().filename();
    if (std::all_of(name.begin(), name.end(), ::isdigit) && !processAlive(std::stoi(name))) {
      problem(when + ": declarations of exited host " + name + " remain");
    }
  }
}

// Every plug-in is listed with its UUID: none was lost, none is left held; no uninstalled one is.
void Soak::checkListed(const std::string& when) {
  auto reply = ask(request("match"));
  std::set<std::string> listed;
  for (const Value& form :
       reply && reply->getArray("matches") ? *reply->getArray("matches") : Array{}) {
    if (const std::string* uuid = form.getString("uuid")) listed.insert(*uuid);
    const std::string* identifier = form.getString("identifier");
    if (identifier && identifier->starts_with("com.test.soak.install")) {
      problem(when + ": uninstalled " + *identifier + " is listed");
    }
  }
  std::vector<Uuid> expected = bench;
  expected.insert(expected.end(), {viewerShare, thumbs, notesShare});
  for (const Uuid& uuid : expected) {
    if (!listed.count(uuid.string())) problem(when + ": " + uuid.string() + " is not listed");
  }
}

// A figure of the idle daemon once it stayed the same for a second: closing connections and
// giving freed heap back reach it a moment after the last client.
template <typename Measure>
auto settled(Measure measure) {
  auto last = measure();
  for (auto end = Clock::now() + seconds(20), since = Clock::now();
       Clock::now() < end && Clock::now() - since < seconds(1); sleepMs(100)) {
    if (auto now = measure(); now != last) {
      last = now;
      since = Clock::now();
    }
  }
  return last;
}

int Soak::run(double duration) {
  // Kill phases first, then the last lifetime of the daemon, whose first third warms it up
  // before its RSS and descriptors are recorded.
  const unsigned killPhases = std::clamp(static_cast<unsigned>(duration / 60), 2u, 10u);
  const double last = std::max(8.0, duration * 0.45);
  const double warmup = std::max(4.0, last / 3);
  const double killPhase = std::max(2.0, (duration - last) / killPhases);
  const auto started = Clock::now();
  Annotator annotator(*this);
  Chaos chaos(*this);
  auto bench = [&](double seconds) {
    return std::make_unique<Child>(
        std::vector<std::string>{ekbench, "-S", daemon.service(), "--connections", "32",
                                 "--duration", fmt::format("{:.3f}", seconds), "--warmup", "0",
                                 "--timeout", "30", "--requests", requests, "--json"},
        output());
  };
  const bool ready = setUp();
  for (unsigned phase = 1; ready && phase <= killPhases && !failed(); ++phase) {
    auto load = bench(killPhase + 120);
    annotator.start();
    chaos.start();
    for (auto end = Clock::now() + milliseconds(static_cast<int64_t>(killPhase * 1000));
         Clock::now() < end && daemon.running();) {
      sleepMs(50);
    }
    chaos.stop();
    if (!processAlive(daemon.pid())) problem(fmt::format("ekd died by itself in phase {}", phase));
    sleepMs(std::uniform_int_distribution<int>(0, 300)(random));
    daemon.kill9();
    annotator.stop();
    load.reset();
    if (!daemon.start()) problem("ekd did not start after SIGKILL: " + daemon.log());
    annotator.verify(fmt::format("after SIGKILL {}", phase), false);
    checkFiles(fmt::format("after SIGKILL {}", phase));
  }
  auto fds = [&] { return descriptorCount(daemon.pid()); };
  auto rss = [&] { return test::residentKiB(daemon.pid()); };
  size_t fdsBefore = 0, fdsAfter = 0;
  long rssBefore = 0, rssAfter = 0;
  for (double seconds : {warmup, last - warmup}) {
    if (!ready || failed()) break;
    if (seconds != warmup) fdsBefore = settled(fds), rssBefore = settled(rss);
    auto load = bench(seconds);
    annotator.start();
    chaos.start();
    finishBench(*load, seconds);
    chaos.stop(true);
    annotator.stop();
    if (!processAlive(daemon.pid())) problem("ekd died during the last lifetime");
  }
  if (ready && !failed()) {
    // All clients are gone: the daemon must be back where the warm-up left it.
    chaos.uninstallAll();
    for (auto end = Clock::now() + seconds(20); fds() != fdsBefore && Clock::now() < end;) {
      sleepMs(100);
    }
    fdsAfter = settled(fds);
    rssAfter = settled(rss);
    if (fdsAfter != fdsBefore)
      problem(fmt::format("ekd leaked descriptors: {} -> {}", fdsBefore, fdsAfter));
    if (!test::kSanitized && rssAfter > rssBefore * (1 + kRssTolerance)) {
      problem(fmt::format("ekd's RSS grew from {} KiB to {} KiB", rssBefore, rssAfter));
    }
    // A declaration written now prunes those of the hosts that exited.
    if (!ask(request("ready", {{"uuids", uuids({viewerShare})}}))) problem("the last ready failed");
    for (pid_t pid : chaos.deadHosts) {
      if (fs::exists(root / "run/services" / std::to_string(pid))) {
        problem(fmt::format("declarations of killed client {} remain", pid));
      }
    }
    checkListed("at the end");
    annotator.verify("at the end", true);
    if (annotator.acknowledged() == 0) problem("no annotation was acknowledged");
    // The files load again after a clean stop.
    if (int status = daemon.terminate(); status != 0)
      problem(fmt::format("ekd exited with {}", status));
    if (!daemon.start()) problem("ekd did not start again: " + daemon.log());
    annotator.verify("after the last restart", true);
    checkListed("after the last restart");
    checkFiles("after the last restart");
  }
  fmt::print("soak: {} in {:.0f} s: {} annotations acknowledged, rss_kib={}->{} fds={}->{}\n",
             failed() ? "FAIL" : "PASS",
             std::chrono::duration<double>(Clock::now() - started).count(),
             annotator.acknowledged(), rssBefore, rssAfter, fdsBefore, fdsAfter);
  for (const std::string& problem : problems) fmt::print("  problem: {}\n", problem);
  return failed() ? 1 : 0;
}

// The client the chaos driver kills: holds a path, declares a service, sends a burst of
// requests without reading the replies and waits (bounded) to be killed.
int clientMode(char** argv) {
  test::RawClient client(argv[2]);
  auto code = [&](const Value& message, uint64_t id) {
    auto reply = client.sendMessage(message, id) ? client.readFrame(kTimeout) : std::nullopt;
    return reply ? std::to_string(test::replyErrorCode(reply->body)) : "none";
  };
  const Uuid uuid = Uuid::parse(argv[4]).value_or(Uuid());
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
  double duration = env ? std::atof(env) : 600;
  uint64_t seed = std::random_device()();
  for (int i = 1; i + 1 < argc; i += 2) {
    if (std::strcmp(argv[i], "--duration") == 0) duration = std::atof(argv[i + 1]);
    if (std::strcmp(argv[i], "--seed") == 0) seed = std::strtoull(argv[i + 1], nullptr, 10);
  }
  if (argc % 2 == 0 || !(duration >= 10 && duration <= 24 * 3600)) {
    std::fprintf(stderr, "usage: ekora_soak [--duration SECONDS (10 to 86400)] [--seed N]\n");
    return 2;
  }
  std::printf("soak: seed %llu\n", static_cast<unsigned long long>(seed));
  ek::soak::Soak soak;
  soak.random.seed(seed);
  return soak.run(duration);
}
