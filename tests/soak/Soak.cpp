// ekora_soak: the whole daemon under sustained mixed load and chaos for a bounded time, then
// checks that nothing it promised was lost or leaked.
//
// ekbench sends every request type from 32 connections (adding and removing a bundle among
// them) while a chaos driver kills hostile clients in the middle of requests (holding Notes, with
// a service declared, replies unread, a malformed frame sent) and ekd is killed with SIGKILL a
// few times. An annotator writes increasing counters to a few plug-ins throughout. After the last
// kill the run warms up, records ekd's RSS and descriptors with no client connected, runs the rest
// of the traffic and records them again. The duration (default 600 s, or $EKORA_SOAK_SECONDS) is
// the traffic time.
//
// Run as `ekora_soak --client SOCKET PATH UUID` it is one of the clients the chaos driver kills.

#include <fcntl.h>
#include <fmt/format.h>
#include <signal.h>
#include <spawn.h>
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

// Under a sanitizer the daemon's memory is the sanitizer's, so its bound cannot be judged.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kSanitized = true;
#else
constexpr bool kSanitized = false;
#endif

// A process's resident memory in KiB, or -1 when it cannot be read.
long residentKiB(pid_t pid) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with("VmRSS:")) return std::stol(line.substr(6));
  }
  return -1;
}

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

void writeDmap(const fs::path& path, const Dictionary& dictionary) {
  fs::create_directories(path.parent_path());
  if (!dmap::writeFileAtomically(path.string(), Value(dictionary), 0644).ok()) std::abort();
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

// The daemon, the world its traffic runs on, the threads of the traffic (annotator and chaos
// driver) and the problems any of them found.
class Soak {
 public:
  int run(double duration, uint64_t seed);

 private:
  void problem(const std::string& what) {
    std::lock_guard lock(mutex_);
    problems_.push_back(what);
  }
  bool failed() {
    std::lock_guard lock(mutex_);
    return !problems_.empty();
  }
  std::optional<Value> ask(const Value& message) const { return daemon_.ask(message, kTimeout); }
  fs::path output() { return root_ / fmt::format("out-{}", outputs_++); }

  Uuid uuidOf(const std::string& path) {
    auto reply = ask(request("find", {{"paths", Value("file://" + path)}}));
    const Value* form = reply ? reply->get("matches") : nullptr;
    const std::string* uuid = form ? form->getString("uuid") : nullptr;
    if (!uuid) problem("no plug-in found at " + path);
    return uuid ? Uuid::parse(*uuid).value_or(Uuid()) : Uuid();
  }

  bool setUp() {
    root_ = fs::canonical(daemon_.root().path());
    daemon_.setEnvironment("EKORA_LOG", "default");
    for (const auto& [key, value] : daemon_.environment()) {  // for every child started later
      setenv(key.c_str(), value.c_str(), 1);
    }
    auto fixture = test::runCommand({BENCH_FIXTURE_PATH, "plugins", "--system-root",
                                     (root_ / "System").string(), "--count",
                                     std::to_string(kBenchPlugIns), "--points", "4"});
    fs::create_directories(root_ / "Applications");
    for (const char* app : {"Viewer.app", "Notes.app"}) {
      fs::copy(fs::path(EXAMPLES_DIR) / "Applications" / app, root_ / "Applications" / app,
               fs::copy_options::recursive);
    }
    const std::string viewer = (root_ / "Applications/Viewer.app").string();
    const std::string churn = (root_ / "Applications/Churn.app").string();
    notes_ = (root_ / "Applications/Notes.app").string();
    // A bundle with one plug-in, which ekbench adds and removes.
    writeDmap(churn + "/Info.dmap", {{"QvBundleIdentifier", "com.test.soak.churn"}});
    writeDmap(churn + "/PlugIns/One.appex/Info.dmap",
              {{"QvBundleIdentifier", "com.test.soak.churn.one"},
               {"ZuExtension", Dictionary{{"ZuExtensionPointIdentifier", "com.corvane.share"},
                                          {"ZuExtensionAttributes", Dictionary{}}}}});
    // ekbench's removals are served only with the manager's entitlement.
    ekbench_ = (root_ / "ekbench").string();
    fs::copy_file(EKBENCH_PATH, ekbench_);
    writeDmap(ekbench_ + ".entitlements", {{kManager, true}});
    if (fixture.status != 0 || !daemon_.start()) {
      problem("set-up failed: " + fixture.err + daemon_.log());
      return false;
    }
    if (!ask(request("add", {{"paths", Array{viewer, notes_, churn}}}))) problem("add failed");
    for (unsigned i = 0; i < kBenchPlugIns; ++i) {
      bench_.push_back(
          uuidOf(fmt::format("{}/System/Library/PlugIns/P{}.bundle", root_.string(), i)));
    }
    viewerShare_ = uuidOf(viewer + "/PlugIns/Share.appex");
    thumbs_ = uuidOf(viewer + "/PlugIns/Thumbs.appex");
    everyPlugIn_ = listed();

    // The request lines ekbench cycles through: every request type, weighted towards the common
    // ones. No hold outlives its request and nothing touches the annotator's plug-ins.
    std::vector<Value> lines{request("add", {{"paths", Array{churn}}}),
                             request("remove", {{"paths", Array{churn}}}), request("match")};
    for (unsigned i = 0; i < 24; ++i) {
      const Uuid a = bench_[kAnnotated + i], b = bench_[kAnnotated + 100 + i];
      const std::string point = fmt::format("com.corvane.bench.point{}", 1 + i % 3);
      lines.push_back(request("find", {{"uuids", a}}));
      lines.push_back(
          request("match", {{"rules", Dictionary{{"ZuExtensionPointIdentifier", point}}}}));
      if (i % 3) continue;
      lines.push_back(request("annotate", {{"annotations", Dictionary{{"election", i % 2}}},
                                           {"uuids", uuids({a, b})}}));
      lines.push_back(request("bulk-annotate",
                              {{"annotations", Dictionary{{b.string(), Dictionary{{"n", i}}}}}}));
      lines.push_back(request("ready", {{"uuids", uuids({viewerShare_, a})}}));
      lines.push_back(request("access", {{"uuids", uuids({thumbs_, b})}}));
      lines.push_back(request("bulk", {{"flags", uint64_t{0}}}));
      lines.push_back(request("lock", {{"uuids", uuids({Uuid::random()})}}));
    }
    std::shuffle(lines.begin(), lines.end(), random_);
    requests_ = (root_ / "requests.jsonl").string();
    std::ofstream out(requests_);
    for (const Value& line : lines) out << wirejson::write(line) << "\n";
    return out.flush() && !failed();
  }

  std::unique_ptr<Child> startBench(double seconds) {
    return std::make_unique<Child>(
        std::vector<std::string>{ekbench_, "-S", daemon_.service(), "--connections", "32",
                                 "--duration", fmt::format("{:.3f}", seconds), "--warmup", "0",
                                 "--timeout", "30", "--requests", requests_, "--json"},
        output());
  }

  // No client is lost while ekd runs: ekbench ends in time with every request answered.
  void finishBench(Child& bench, double duration) {
    auto status = bench.wait(milliseconds(static_cast<int64_t>(duration * 1000)) + seconds(90));
    auto report = nlohmann::json::parse(bench.output(), nullptr, false);
    if (!status || report.is_discarded() || !report.contains("daemon")) {
      return problem("ekbench ended without a report: " + bench.output());
    }
    if (*status != 0 || report["daemon"].value("requests", 0) == 0 ||
        report["daemon"].value("failures", 0) != 0) {
      problem(
          fmt::format("ekbench (status {}) lost clients: {}", *status, report["daemon"].dump()));
    }
  }

  void startTraffic() {
    stop_ = stopChaos_ = false;
    annotator_ = std::thread([this] { annotate(); });
    chaos_ = std::thread([this] { chaos(); });
  }
  // Stops the chaos driver after its current action, then the annotator when asked to.
  void stopTraffic(bool annotator) {
    stopChaos_ = true;
    if (chaos_.joinable()) chaos_.join();
    stop_ = annotator;
    if (annotator) annotator_.join();
  }

  // Writes increasing counters ("extension" {"soak": n}) to its plug-ins over one connection and
  // records every value sent and the last one acknowledged for each plug-in.
  void annotate() {
    std::unique_ptr<test::RawClient> client;
    for (uint64_t id = ++lastId_; !stop_; id = ++lastId_) {
      if (!client) client = std::make_unique<test::RawClient>(daemon_.socketPath());
      const unsigned i = id % kAnnotated;
      sent_[i].insert(id);
      const Value body =
          request("annotate", {{"annotations", Dictionary{{"extension", Dictionary{{"soak", id}}}}},
                               {"uuids", uuids({bench_[i]})}});
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

  // Each counter stored is one that was sent and no older than the last acknowledged: exactly
  // that one when nothing was left unanswered.
  void verifyAnnotations(const std::string& when, bool exact) {
    for (unsigned i = 0; i < kAnnotated; ++i) {
      auto reply = ask(request("find", {{"uuids", Value(bench_[i])}}));
      const Value* extension = reply ? &*reply : nullptr;
      for (const char* key : {"matches", "annotations", "extension"}) {
        extension = extension ? extension->get(key) : nullptr;
      }
      const uint64_t* stored = extension ? extension->getUnsigned("soak") : nullptr;
      if (stored
              ? !sent_[i].count(*stored) || *stored < acked_[i] || (exact && *stored != acked_[i])
              : acked_[i] != 0) {
        problem(fmt::format("{}: P{} holds {}, last acknowledged {}", when, i, stored ? *stored : 0,
                            acked_[i]));
      }
    }
  }

  // Starts clients that hold Notes, declare Viewer's share service, send a burst of requests with
  // large replies and are killed while they do not read them.
  void chaos() {
    for (; !stopChaos_; sleepMs(std::uniform_int_distribution<int>(20, 150)(chaosRandom_))) {
      Child child({fs::read_symlink("/proc/self/exe"), "--client", daemon_.socketPath(), notes_,
                   viewerShare_.string()},
                  output());
      for (auto end = Clock::now() + kTimeout;
           Clock::now() < end && !child.output().ends_with("sent\n");) {
        sleepMs(10);
      }
      if (child.output() != "ready 00 0\nsent\n") problem("raw client: " + child.output());
      sleepMs(std::uniform_int_distribution<int>(0, 500)(chaosRandom_));
      child.kill9();
      deadHosts_.push_back(child.pid());
    }
  }

  // Nothing was found broken: no store was reset or moved aside, no undefined behaviour.
  void checkFiles(const std::string& when) {
    std::ifstream log(daemon_.root().path() / "ekd.log");
    for (std::string line; std::getline(log, line);) {
      for (const char* bad : {"(resetting)", "moved aside", "kept unusable", "runtime error:"}) {
        if (line.find(bad) != std::string::npos) problem(when + ": ekd logged: " + line);
      }
    }
  }

  // The plug-ins "match" lists, but for the one ekbench adds and removes.
  std::set<std::string> listed() {
    auto reply = ask(request("match"));
    std::set<std::string> uuids;
    for (const Value& form :
         reply && reply->getArray("matches") ? *reply->getArray("matches") : Array{}) {
      const std::string* identifier = form.getString("identifier");
      if (identifier && !identifier->starts_with("com.test.soak.churn")) {
        uuids.insert(*form.getString("uuid"));
      }
    }
    return uuids;
  }

  test::EkdProcess daemon_;
  fs::path root_;  // canonical root of the daemon's directories
  std::string notes_, ekbench_, requests_;
  std::vector<Uuid> bench_;  // by index i: System/Library/PlugIns/P<i>.bundle
  Uuid viewerShare_, thumbs_;
  std::set<std::string> everyPlugIn_;  // none may be lost or left held at the end
  std::mt19937_64 random_, chaosRandom_;
  std::atomic<unsigned> outputs_{0};
  std::atomic<bool> stop_{false}, stopChaos_{false};
  std::thread annotator_, chaos_;
  std::mutex mutex_;
  std::vector<std::string> problems_;
  // The annotator's: values sent and last acknowledged for each plug-in.
  std::set<uint64_t> sent_[kAnnotated];
  uint64_t acked_[kAnnotated] = {}, lastId_ = 0;
  std::atomic<uint64_t> acknowledged_{0};
  // The chaos driver's.
  std::vector<pid_t> deadHosts_;
};

int Soak::run(double duration, uint64_t seed) {
  // Kill phases first, then the last lifetime of the daemon, whose first third warms it up
  // before its RSS and descriptors are recorded.
  const unsigned killPhases = std::clamp(static_cast<unsigned>(duration / 60), 2u, 10u);
  const double last = std::max(8.0, duration * 0.45);
  const double warmup = std::max(4.0, last / 3);
  const double killPhase = std::max(2.0, (duration - last) / killPhases);
  const auto started = Clock::now();
  random_.seed(seed);
  chaosRandom_.seed(random_());
  const bool ready = setUp();
  for (unsigned phase = 1; ready && phase <= killPhases && !failed(); ++phase) {
    auto bench = startBench(killPhase + 120);
    startTraffic();
    sleepMs(static_cast<int>(killPhase * 1000));
    siginfo_t exited{};  // WNOWAIT: the daemon's owner reaps it
    waitid(P_PID, daemon_.pid(), &exited, WEXITED | WNOHANG | WNOWAIT);
    if (exited.si_pid != 0) problem(fmt::format("ekd died by itself in phase {}", phase));
    stopTraffic(false);
    sleepMs(std::uniform_int_distribution<int>(0, 300)(random_));
    daemon_.kill9();
    stopTraffic(true);
    bench.reset();
    if (!daemon_.start()) problem("ekd did not start after SIGKILL: " + daemon_.log());
    verifyAnnotations(fmt::format("after SIGKILL {}", phase), false);
    checkFiles(fmt::format("after SIGKILL {}", phase));
  }
  // The descriptors and RSS of the idle daemon once they stayed the same for a second: closed
  // connections and freed heap reach it a moment after the last client.
  auto idle = [&] {
    auto measure = [&] {
      std::error_code error;
      fs::directory_iterator fds(fmt::format("/proc/{}/fd", daemon_.pid()), error);
      return std::pair(std::distance(fds, {}), residentKiB(daemon_.pid()));
    };
    auto last = measure();
    for (auto end = Clock::now() + seconds(20), since = Clock::now();
         Clock::now() < end && Clock::now() - since < seconds(1); sleepMs(100)) {
      if (auto now = measure(); now != last) {
        last = now;
        since = Clock::now();
      }
    }
    return last;
  };
  long fdsBefore = 0, fdsAfter = 0;
  long rssBefore = 0, rssAfter = 0;
  for (double seconds : {warmup, last - warmup}) {
    if (!ready || failed()) break;
    if (seconds != warmup) std::tie(fdsBefore, rssBefore) = idle();
    auto bench = startBench(seconds);
    startTraffic();
    finishBench(*bench, seconds);
    stopTraffic(true);
  }
  if (ready && !failed()) {
    // All clients are gone: the daemon must be back where the warm-up left it.
    std::tie(fdsAfter, rssAfter) = idle();
    if (fdsAfter != fdsBefore)
      problem(fmt::format("ekd leaked descriptors: {} -> {}", fdsBefore, fdsAfter));
    if (!kSanitized && rssAfter > rssBefore * (1 + kRssTolerance)) {
      problem(fmt::format("ekd's RSS grew from {} KiB to {} KiB", rssBefore, rssAfter));
    }
    // A declaration written now prunes those of the hosts that exited.
    if (!ask(request("ready", {{"uuids", uuids({viewerShare_})}})))
      problem("the last ready failed");
    for (pid_t pid : deadHosts_) {
      if (fs::exists(root_ / "run/services" / std::to_string(pid))) {
        problem(fmt::format("declarations of killed client {} remain", pid));
      }
    }
    if (acknowledged_ == 0) problem("no annotation was acknowledged");
    if (listed() != everyPlugIn_) problem("at the end plug-ins were lost or left held");
    // The files load again after a clean stop.
    if (int status = daemon_.terminate(); status != 0)
      problem(fmt::format("ekd exited with {}", status));
    if (!daemon_.start()) problem("ekd did not start again: " + daemon_.log());
    verifyAnnotations("after the last restart", true);
    if (listed() != everyPlugIn_) problem("after the last restart plug-ins were lost");
    checkFiles("after the last restart");
  }
  fmt::print(
      "soak: {} in {:.0f} s (seed {}): {} annotations acknowledged, rss_kib={}->{} fds={}->{}\n",
      failed() ? "FAIL" : "PASS", std::chrono::duration<double>(Clock::now() - started).count(),
      seed, acknowledged_.load(), rssBefore, rssAfter, fdsBefore, fdsAfter);
  for (const std::string& problem : problems_) fmt::print("  problem: {}\n", problem);
  return failed() ? 1 : 0;
}

// The client the chaos driver kills: holds a path twice, declares a service, sends a burst of
// requests without reading the replies and waits (bounded) to be killed.
int clientMode(char** argv) {
  test::RawClient client(argv[2]);
  auto code = [&](const Value& message, uint64_t id) {
    auto reply = client.sendMessage(message, id) ? client.readFrame(kTimeout) : std::nullopt;
    return reply ? std::to_string(test::replyErrorCode(reply->body)) : "none";
  };
  const Uuid uuid = Uuid::parse(argv[4]).value_or(Uuid());
  const std::string held = code(request("lock", {{"paths", Array{argv[3]}}}), 1) +
                           code(request("lock", {{"paths", Array{argv[3]}}}), 2);
  fmt::print("ready {} {}\n", held, code(request("ready", {{"uuids", uuids({uuid})}}), 3));
  for (uint64_t id = 4; id < 200; ++id) {
    client.sendMessage(id % 2 ? request("match") : request("access", {{"uuids", uuids({uuid})}}),
                       id);
  }
  // And a frame longer than any the daemon accepts, which must cost it nothing but this client.
  std::vector<uint8_t> header(wyre::kHeaderSize);
  wyre::encodeHeader({wyre::kMaxBodySize + 1, wyre::kFlagWantsReply, 200}, header.data());
  client.sendBytes(header);
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
  return ek::soak::Soak().run(duration, seed);
}
