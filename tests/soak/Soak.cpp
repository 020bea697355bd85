// ekora_soak: the whole daemon under mixed load and chaos for a bounded time, then checks that
// nothing it promised was lost or leaked.
//
//   ekora_soak [--duration SECONDS] [--seed N]
//
// ekbench sends all ten request types from 32 connections while a chaos driver kills clients
// in the middle of requests (some holding plug-ins, some that made plug-ins ready), installs
// and uninstalls bundles, sends malformed frames, keeps a connection that never reads its
// replies, and kills ekd with SIGKILL a few times. A dedicated annotator writes increasing
// counters to a few plug-ins throughout. After the last kill the run warms up, records ekd's
// RSS and descriptor count with no client connected, runs the rest of the traffic and records
// them again. The duration (default 600 s, or $EKORA_SOAK_SECONDS) is the traffic time; start-up,
// restarts and checks come on top.
//
// Run as `ekora_soak --client MODE ...` it is one of the raw clients the chaos driver kills.

#include <fmt/format.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <mutex>
#include <nlohmann/json.hpp>
#include <optional>
#include <random>
#include <set>
#include <sstream>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "platform/cbor/Cbor.h"
#include "platform/dmap/Dmap.h"
#include "platform/json/WireJson.h"
#include "platform/value/Uuid.h"
#include "platform/wyre/Wyre.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"
#include "tests/soak/Child.h"

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define EK_SOAK_SANITIZED 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define EK_SOAK_SANITIZED 1
#endif
#endif

namespace ek::soak {
namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;
using std::chrono::seconds;
using test::EkdProcess;
using test::RawClient;
using test::replyErrorCode;
using test::request;

// The sanitizers' allocators keep freed memory in quarantine and map shadow memory as the heap
// grows, so ekd's RSS under them says nothing about leaks; the descriptor check still runs.
#ifdef EK_SOAK_SANITIZED
constexpr bool kCheckRss = false;
#else
constexpr bool kCheckRss = true;
#endif

constexpr unsigned kConnections = 32;
constexpr unsigned kBenchPlugIns = 200;
constexpr unsigned kBenchPoints = 4;
// The annotator's plug-ins: bench plug-ins P0 .. P(kAnnotated - 1). ekbench never touches them.
constexpr unsigned kAnnotated = 8;
constexpr double kRssTolerance = 0.10;
constexpr const char* kManager = "com.corvane.private.ekora.manager";
constexpr const char* kSharePoint = "com.corvane.share";
constexpr const char* kNotesShare = "com.corvane.example.notes.share";
constexpr const char* kViewerShare = "com.corvane.example.viewer.share";
constexpr const char* kBenchPrefix = "com.corvane.bench.p";
// Every wait on the daemon is bounded by this, so a dead or wedged ekd fails the run.
constexpr milliseconds kReplyTimeout = seconds(30);
constexpr milliseconds kSettleTimeout = seconds(20);

std::string now() {
  auto t = std::chrono::system_clock::to_time_t(std::chrono::system_clock::now());
  std::tm tm{};
  localtime_r(&t, &tm);
  char text[16];
  std::strftime(text, sizeof text, "%H:%M:%S", &tm);
  return text;
}

void note(const std::string& text) {
  std::fprintf(stderr, "[%s] soak: %s\n", now().c_str(), text.c_str());
}

// Problems found by any thread; the run fails when there is one.
class Problems {
 public:
  void add(const std::string& what) {
    note("PROBLEM: " + what);
    std::lock_guard lock(mutex_);
    list_.push_back(what);
  }
  std::vector<std::string> list() const {
    std::lock_guard lock(mutex_);
    return list_;
  }
  size_t count() const {
    std::lock_guard lock(mutex_);
    return list_.size();
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> list_;
};

struct Counters {
  std::atomic<uint64_t> requests{0};
  std::atomic<uint64_t> errorReplies{0};
  std::atomic<uint64_t> failures{0};
  std::atomic<uint64_t> failuresWhileRunning{0};
  std::atomic<uint64_t> clientsKilled{0};
  std::atomic<uint64_t> garbageFrames{0};
  std::atomic<uint64_t> installs{0};
  std::atomic<uint64_t> uninstalls{0};
  std::atomic<uint64_t> restarts{0};
  std::atomic<uint64_t> nonReaderRequests{0};
  std::atomic<uint64_t> nonReaderClosed{0};
};

// ---- Small helpers ---------------------------------------------------------------------------

bool processAlive(pid_t pid) {
  std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
  std::string text;
  if (!std::getline(stat, text)) return false;
  size_t paren = text.rfind(')');
  return paren != std::string::npos && paren + 2 < text.size() && text[paren + 2] != 'Z';
}

std::optional<uint64_t> rssKiB(pid_t pid) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.rfind("VmRSS:", 0) == 0) return std::stoull(line.substr(6));
  }
  return std::nullopt;
}

// The descriptors of a process: number -> what it points at.
std::map<int, std::string> descriptors(pid_t pid) {
  std::map<int, std::string> out;
  std::error_code error;
  fs::path dir = "/proc/" + std::to_string(pid) + "/fd";
  for (const auto& entry : fs::directory_iterator(dir, error)) {
    std::error_code ignored;
    std::string name = entry.path().filename().string();
    out[std::atoi(name.c_str())] = fs::read_symlink(entry.path(), ignored).string();
  }
  return out;
}

std::string describeDescriptors(const std::map<int, std::string>& fds) {
  std::string text;
  for (const auto& [fd, target] : fds) text += fmt::format(" {}={}", fd, target);
  return text;
}

void writeDmap(const fs::path& path, const Dictionary& dictionary) {
  auto written = dmap::writeFileAtomically(path.string(), Value(dictionary), 0644);
  if (!written.ok()) {
    throw std::runtime_error(path.string() + ": " + written.error().message);
  }
}

void writeScript(const fs::path& path) {
  std::ofstream(path) << "#!/bin/sh\nexit 0\n";
  fs::permissions(path, fs::perms(0755));
}

// An application bundle with two plug-ins on the share point.
void writeApp(const fs::path& bundle, const std::string& identifier) {
  std::string name = bundle.stem().string();
  fs::create_directories(bundle / "PlugIns");
  writeDmap(bundle / "Info.dmap", {{"QvBundleIdentifier", Value(identifier)},
                                   {"QvBundleName", Value(name)},
                                   {"QvBundleExecutable", Value(name)}});
  writeScript(bundle / name);
  for (const char* plugIn : {"One", "Two"}) {
    fs::path appex = bundle / "PlugIns" / (std::string(plugIn) + ".appex");
    fs::create_directories(appex);
    Dictionary extension{
        {"ZuExtensionPointIdentifier", Value(kSharePoint)},
        {"ZuExtensionAttributes",
         Value(Dictionary{{"ZuExtensionVersion", Value("1.0")}, {"SoakKind", Value("churn")}})}};
    writeDmap(appex / "Info.dmap", {{"QvBundleIdentifier", Value(identifier + "." + plugIn)},
                                    {"QvBundleName", Value(plugIn)},
                                    {"QvBundleExecutable", Value(plugIn)},
                                    {"QvBundleVersion", Value("1.0")},
                                    {"ZuExtension", Value(std::move(extension))}});
    writeScript(appex / plugIn);
  }
}

// A copy of program in dir whose entitlements grant the manager's, so that its "remove" and
// privileged "match" flags are served rather than refused.
std::string entitledCopy(const std::string& program, const fs::path& dir) {
  fs::create_directories(dir);
  fs::path copy = dir / fs::path(program).filename();
  fs::copy_file(program, copy, fs::copy_options::overwrite_existing);
  fs::permissions(copy, fs::perms(0755));
  writeDmap(copy.string() + ".entitlements", {{kManager, Value(true)}});
  return copy.string();
}

std::string selfPath() {
  std::error_code error;
  return fs::read_symlink("/proc/self/exe", error).string();
}

// ---- The world the traffic runs on -------------------------------------------------------------

struct World {
  fs::path root;  // canonical root of the daemon's directories
  fs::path apps;
  std::string viewer, notes, churn;
  std::string notesShare, viewerShare, thumbs;
  std::vector<Uuid> bench;  // by index i: System/Library/PlugIns/P<i>.bundle
  Uuid viewerShareUuid, notesShareUuid, thumbsUuid;
  std::string ekctl;    // entitled copy
  std::string ekbench;  // entitled copy
  std::string requestsFile;

  std::string benchPath(unsigned i) const {
    return (root / "System/Library/PlugIns" / ("P" + std::to_string(i) + ".bundle")).string();
  }
};

Value uuidArray(std::initializer_list<Uuid> uuids) {
  Array array;
  for (const Uuid& uuid : uuids) array.emplace_back(uuid);
  return Value(std::move(array));
}

Value shareRules() {
  return Value(Dictionary{{"ZuExtensionPointIdentifier", Value(kSharePoint)}});
}

// The request lines ekbench cycles through: every request type, weighted towards the common
// ones. Nothing here places a hold that outlives its request (ekbench connections live for the
// whole run, and holds last as long as their connection), and nothing touches the annotator's
// plug-ins.
std::vector<Value> benchRequests(const World& w, std::mt19937_64& random) {
  std::vector<Value> out;
  auto benchUuid = [&](unsigned salt) {
    return w.bench[kAnnotated + salt % (kBenchPlugIns - kAnnotated)];
  };
  for (unsigned i = 0; i < 24; ++i) {
    out.push_back(request("find", {{"uuids", Value(benchUuid(i * 7))}}));
    out.push_back(request("find", {{"paths", Value("file://" + w.benchPath(kAnnotated + i))}}));
    out.push_back(request(
        "match", {{"rules", Value(Dictionary{
                                {"ZuExtensionPointIdentifier",
                                 Value("com.corvane.bench.point" + std::to_string(1 + i % 3))}})},
                  {"flags", Value(uint64_t{0})}}));
  }
  for (unsigned i = 0; i < 8; ++i) {
    out.push_back(
        request("annotate",
                {{"annotations", Value(Dictionary{{"extension", Value(Dictionary{{"n", Value(i)}})},
                                                  {"election", Value(i % 2)}})},
                 {"uuids", uuidArray({benchUuid(i), benchUuid(i + 50)})}}));
    out.push_back(
        request("bulk-annotate",
                {{"annotations", Value(Dictionary{{benchUuid(i + 100).string(),
                                                   Value(Dictionary{{"bulk", Value(i)}})}})}}));
    out.push_back(request("ready", {{"uuids", uuidArray({w.viewerShareUuid, benchUuid(i + 20)})},
                                    {"flags", Value(uint64_t{0})}}));
    out.push_back(request("access", {{"uuids", uuidArray({w.thumbsUuid, benchUuid(i + 30)})},
                                     {"flags", Value(uint64_t{0})}}));
    out.push_back(request("match", {{"rules", shareRules()}}));
    out.push_back(request("bulk", {{"flags", Value(uint64_t{0})}}));
    // Releasing a hold nobody placed succeeds and changes nothing; a hold on a missing path
    // fails after the paths are read.
    out.push_back(request("lock", {{"uuids", uuidArray({Uuid::random()})}}));
    out.push_back(request("lock", {{"paths", Value(Array{Value(w.apps.string() + "/Missing.app")})},
                                   {"flags", Value(uint64_t{0})}}));
  }
  for (unsigned i = 0; i < 3; ++i) {
    out.push_back(request("add", {{"paths", Value(Array{Value(w.churn)})}}));
    out.push_back(request("remove", {{"paths", Value(Array{Value(w.churn)})}}));
  }
  // Every plug-in at once, and everything the manager may see.
  out.push_back(request("match", {}));
  out.push_back(request("match", {{"rules", shareRules()}, {"flags", Value(uint64_t{0x200})}}));
  std::shuffle(out.begin(), out.end(), random);
  return out;
}

// ---- The annotator -----------------------------------------------------------------------------

// Writes increasing counters ("extension" {"soak": n}) to its plug-ins over one connection,
// one request at a time, and records every value it sent and the last one acknowledged.
class Annotator {
 public:
  Annotator(const World& world, Problems& problems) : problems_(problems) {
    for (unsigned i = 0; i < kAnnotated; ++i) targets_.push_back({world.bench[i], {}, 0});
  }
  ~Annotator() { stop(); }

  void start(const std::string& socket) {
    stop_ = false;
    thread_ = std::thread([this, socket] { run(socket); });
  }
  void stop() {
    stop_ = true;
    if (thread_.joinable()) thread_.join();
  }

  uint64_t acknowledged() const { return acknowledged_; }
  uint64_t transportFailures() const { return transportFailures_; }

  // Checks every plug-in's stored counter as "find" answers it: the last acknowledged value or
  // a later one that was sent (exactly the last acknowledged one when nothing was left
  // unanswered). Answers the number of plug-ins checked.
  uint64_t verify(const EkdProcess& daemon, const std::string& when, bool exact) {
    std::lock_guard lock(mutex_);
    uint64_t checked = 0;
    for (size_t i = 0; i < targets_.size(); ++i) {
      const Target& target = targets_[i];
      auto reply = daemon.ask(request("find", {{"uuids", Value(target.uuid)}}), kReplyTimeout);
      if (!reply) {
        problems_.add(fmt::format("{}: no reply to find of annotated plug-in P{}", when, i));
        continue;
      }
      const Value* form = reply->get("matches");
      const Value* annotations = form ? form->get("annotations") : nullptr;
      const Dictionary* extension = annotations ? annotations->getDictionary("extension") : nullptr;
      std::optional<uint64_t> stored;
      if (extension) {
        auto it = extension->find("soak");
        if (it != extension->end() && it->second.unsignedNumber())
          stored = *it->second.unsignedNumber();
      }
      ++checked;
      if (target.acked == 0) {
        if (stored && !target.sent.count(*stored)) {
          problems_.add(fmt::format("{}: P{} holds {}, a value never sent", when, i, *stored));
        }
        continue;
      }
      if (!stored) {
        problems_.add(fmt::format("{}: P{} lost its annotation (last acknowledged {}): {}", when, i,
                                  target.acked, reply->description()));
      } else if (*stored < target.acked || !target.sent.count(*stored)) {
        problems_.add(fmt::format("{}: P{} holds {}, last acknowledged {}{}", when, i, *stored,
                                  target.acked, target.sent.count(*stored) ? "" : " (never sent)"));
      } else if (exact && *stored != target.acked) {
        problems_.add(
            fmt::format("{}: P{} holds {}, expected exactly {}", when, i, *stored, target.acked));
      }
    }
    verified_ += checked;
    return checked;
  }
  uint64_t verified() const { return verified_; }

 private:
  struct Target {
    Uuid uuid;
    std::set<uint64_t> sent;
    uint64_t acked;  // 0: none yet (values start at 1)
  };

  void run(const std::string& socket) {
    std::unique_ptr<RawClient> client;
    uint64_t id = 0;
    size_t turn = 0;
    while (!stop_) {
      if (!client || !client->connected()) {
        client = std::make_unique<RawClient>(socket);
        if (!client->connected()) {
          std::this_thread::sleep_for(milliseconds(50));
          continue;
        }
      }
      // Mostly "annotate" of one plug-in; every fourth write a "bulk-annotate" of two.
      std::vector<std::pair<size_t, uint64_t>> writes;
      Value message;
      {
        std::lock_guard lock(mutex_);
        size_t a = turn++ % targets_.size();
        writes.push_back({a, ++nextValue_});
        if (turn % 4 == 0) {
          size_t b = (a + 3) % targets_.size();
          writes.push_back({b, ++nextValue_});
          Dictionary entries;
          for (auto [index, value] : writes) {
            entries.emplace(targets_[index].uuid.string(),
                            Value(Dictionary{{"soak", Value(value)}}));
          }
          message = request("bulk-annotate", {{"annotations", Value(std::move(entries))}});
        } else {
          message =
              request("annotate",
                      {{"annotations",
                        Value(Dictionary{
                            {"extension", Value(Dictionary{{"soak", Value(writes[0].second)}})}})},
                       {"uuids", uuidArray({targets_[a].uuid})}});
        }
        for (auto [index, value] : writes) targets_[index].sent.insert(value);
      }
      ++id;
      std::optional<RawClient::Frame> reply;
      if (client->sendMessage(message, id)) reply = client->readFrame(kReplyTimeout);
      if (!reply) {
        ++transportFailures_;
        client.reset();
        continue;
      }
      if (reply->id != id) {
        problems_.add(fmt::format("annotator: reply id {} to request {}", reply->id, id));
        client.reset();
        continue;
      }
      if (replyErrorCode(reply->body) != 0) {
        problems_.add("annotator: write refused: " + reply->body.description());
        continue;
      }
      std::lock_guard lock(mutex_);
      for (auto [index, value] : writes) {
        targets_[index].acked = std::max(targets_[index].acked, value);
        ++acknowledged_;
      }
    }
  }

  Problems& problems_;
  std::mutex mutex_;
  std::vector<Target> targets_;
  uint64_t nextValue_ = 0;
  std::atomic<uint64_t> acknowledged_{0};
  std::atomic<uint64_t> transportFailures_{0};
  std::atomic<uint64_t> verified_{0};
  std::atomic<bool> stop_{false};
  std::thread thread_;
};

// ---- The chaos driver --------------------------------------------------------------------------

enum class Garbage {
  HugeLength,
  JustOverMaximum,
  NotCbor,
  TruncatedFrame,
  TruncatedCbor,
  UnknownFlags,
  ReplyFlag,
  DeepNesting,
  EmptyBody,
  NotAMap,
  Count
};

const char* garbageName(Garbage kind) {
  switch (kind) {
    case Garbage::HugeLength:
      return "length 0xffffffff";
    case Garbage::JustOverMaximum:
      return "length one past the maximum";
    case Garbage::NotCbor:
      return "a body that is not CBOR";
    case Garbage::TruncatedFrame:
      return "a frame cut short";
    case Garbage::TruncatedCbor:
      return "a CBOR item cut short";
    case Garbage::UnknownFlags:
      return "unknown flag bits";
    case Garbage::ReplyFlag:
      return "a request marked as a reply";
    case Garbage::DeepNesting:
      return "100,000 nested arrays";
    case Garbage::EmptyBody:
      return "an empty body";
    case Garbage::NotAMap:
      return "a body that is not a map";
    case Garbage::Count:
      break;
  }
  return "?";
}

class Chaos {
 public:
  Chaos(EkdProcess& daemon, const World& world, Problems& problems, Counters& counters,
        uint64_t seed)
      : daemon_(daemon), world_(world), problems_(problems), counters_(counters), random_(seed) {}
  ~Chaos() { stop(); }

  void start() {
    stop_ = false;
    rounds_ = 0;
    thread_ = std::thread([this] { run(); });
  }
  // Stops after the current action; with wholeRound, not before one round of every action
  // has run since start (so a warm-up sees each of them).
  void stop(bool wholeRound = false) {
    if (wholeRound) {
      auto deadline = Clock::now() + seconds(120);
      while (rounds_ == 0 && Clock::now() < deadline && thread_.joinable()) {
        std::this_thread::sleep_for(milliseconds(50));
      }
    }
    stop_ = true;
    if (thread_.joinable()) thread_.join();
  }

  // The pids of killed clients that may have declared plug-ins, all reaped.
  std::vector<pid_t> deadHosts() const {
    std::lock_guard lock(mutex_);
    return deadHosts_;
  }
  // Uninstalls what is still installed, so that the end state is known.
  void uninstallAll() {
    while (!installed_.empty()) uninstallOldest();
  }
  unsigned rounds() const { return rounds_; }

 private:
  using Action = void (Chaos::*)();

  void run() {
    std::vector<Action> round{&Chaos::ekctlHold,  &Chaos::rawHold,         &Chaos::rawReady,
                              &Chaos::ekctlReady, &Chaos::ekctlMidRequest, &Chaos::rawMidRequest,
                              &Chaos::install,    &Chaos::garbage,         &Chaos::garbage,
                              &Chaos::garbage,    &Chaos::ekctlMidRequest};
    while (!stop_) {
      std::shuffle(round.begin(), round.end(), random_);
      for (Action action : round) {
        if (stop_) break;
        try {
          topUpNonReader();
          (this->*action)();
          if (installed_.size() > 2) uninstallOldest();
        } catch (const std::exception& e) {
          problems_.add(std::string("chaos driver: ") + e.what());
        }
        std::this_thread::sleep_for(
            milliseconds(std::uniform_int_distribution<int>(20, 150)(random_)));
      }
      if (!stop_) ++rounds_;
    }
    closeNonReader();
  }

  std::map<std::string, std::string> env() const { return daemon_.environment(); }

  std::optional<Value> ask(const Value& message) const {
    return daemon_.ask(message, kReplyTimeout);
  }

  // The daemon must answer a cheap request after whatever was just done to it.
  void expectAnswering(const std::string& after) {
    auto reply = ask(request("bulk"));
    if (!reply) problems_.add("ekd stopped answering after " + after);
  }

  // Whether "match" of the share point lists the identifier.
  std::optional<bool> shareListed(const std::string& identifier) {
    auto reply = ask(request("match", {{"rules", shareRules()}}));
    if (!reply) return std::nullopt;
    const Array* matches = reply->getArray("matches");
    if (!matches) return std::nullopt;
    for (const Value& form : *matches) {
      const std::string* id = form.getString("identifier");
      if (id && *id == identifier) return true;
    }
    return false;
  }

  bool waitListed(const std::string& identifier, bool listed) {
    auto deadline = Clock::now() + kSettleTimeout;
    while (Clock::now() < deadline) {
      if (shareListed(identifier) == listed) return true;
      std::this_thread::sleep_for(milliseconds(20));
    }
    return false;
  }

  void killed(Child& child, bool mayHaveDeclared) {
    child.kill9();
    ++counters_.clientsKilled;
    if (mayHaveDeclared) {
      std::lock_guard lock(mutex_);
      deadHosts_.push_back(child.pid());
    }
  }

  // A hold placed by a client that is then killed must end with its connection.
  void checkHoldOf(std::unique_ptr<Child> child, bool held, const std::string& who) {
    if (held && shareListed(kNotesShare) != false) {
      problems_.add(who + ": Notes' share plug-in still listed while held");
    }
    killed(*child, false);
    if (!waitListed(kNotesShare, true)) {
      problems_.add(fmt::format("{} (pid {}) was killed but its hold on Notes was not released",
                                who, child->pid()));
    }
  }

  void ekctlHold() {
    auto child = Child::spawn(
        {test::ekctlPath(), "-S", daemon_.service(), "--json", "hold", world_.notes}, env());
    if (!child) return problems_.add("cannot start ekctl hold");
    auto line = child->waitForLine("{", kReplyTimeout);
    if (!line) {
      auto status = child->wait(milliseconds(100));
      problems_.add(fmt::format("ekctl hold placed no hold (status {}): {}", status.value_or(-1),
                                child->output()));
    }
    checkHoldOf(std::move(child), line.has_value(), "ekctl hold");
  }

  void rawHold() {
    auto child =
        Child::spawn({selfPath(), "--client", "hold", daemon_.socketPath(), world_.notes}, env());
    if (!child) return problems_.add("cannot start the raw holder");
    auto held = child->waitForLine("held ", kReplyTimeout);
    bool placed = held && *held == "held 0";
    if (!placed) problems_.add("raw holder: " + held.value_or("no answer") + " " + child->output());
    // Killed while its next request is outstanding.
    child->waitForLine("sent", kReplyTimeout);
    checkHoldOf(std::move(child), placed, "raw holder");
  }

  void rawReady() {
    auto child = Child::spawn(
        {selfPath(), "--client", "ready", daemon_.socketPath(), world_.viewerShareUuid.string()},
        env());
    if (!child) return problems_.add("cannot start the raw ready client");
    auto ready = child->waitForLine("ready ", kReplyTimeout);
    if (ready && *ready == "ready 0") {
      fs::path declaration = world_.root / "run/services" / std::to_string(child->pid()) /
                             (std::string(kViewerShare) + ".dmap");
      if (!fs::exists(declaration)) {
        problems_.add("ready answered but no declaration at " + declaration.string());
      }
    } else {
      problems_.add("raw ready client: " + ready.value_or("no answer") + " " + child->output());
    }
    child->waitForLine("sent", kReplyTimeout);
    killed(*child, true);
  }

  int randomDelayMs(int most) { return std::uniform_int_distribution<int>(0, most)(random_); }

  void ekctlReady() {
    auto child = Child::spawn({test::ekctlPath(), "-S", daemon_.service(), "ready",
                               world_.viewerShareUuid.string(), world_.thumbsUuid.string()},
                              env());
    if (!child) return problems_.add("cannot start ekctl ready");
    std::this_thread::sleep_for(milliseconds(randomDelayMs(40)));
    killed(*child, true);
  }

  void ekctlMidRequest() {
    std::vector<std::vector<std::string>> commands{
        {"match", R"({"ZuExtensionPointIdentifier":"com.corvane.bench.point0"})"},
        {"find", "--uuid", world_.bench[kAnnotated + 5].string()},
        {"access", world_.thumbsUuid.string()},
        {"annotate", "--set", R"({"extension":{"ekctl":1}})",
         world_.bench[kAnnotated + 9].string()},
        {"add", world_.viewer},
        {"bulk"},
        {"hold", world_.viewer},
    };
    auto& command =
        commands[std::uniform_int_distribution<size_t>(0, commands.size() - 1)(random_)];
    std::vector<std::string> argv{test::ekctlPath(), "-S", daemon_.service()};
    argv.insert(argv.end(), command.begin(), command.end());
    auto child = Child::spawn(argv, env());
    if (!child) return problems_.add("cannot start ekctl " + command[0]);
    std::this_thread::sleep_for(milliseconds(randomDelayMs(60)));
    killed(*child, false);
    if (command[0] == "hold" && !waitListed(kViewerShare, true)) {
      problems_.add("a killed ekctl hold left Viewer held");
    }
  }

  void rawMidRequest() {
    std::vector<std::string> argv{selfPath(),
                                  "--client",
                                  "burst",
                                  daemon_.socketPath(),
                                  world_.viewerShareUuid.string(),
                                  world_.bench[kAnnotated + 11].string()};
    auto child = Child::spawn(argv, env());
    if (!child) return problems_.add("cannot start the raw burst client");
    child->waitForLine("sent", kReplyTimeout);
    std::this_thread::sleep_for(milliseconds(randomDelayMs(5)));
    killed(*child, true);
  }

  void install() {
    unsigned n = nextInstall_++;
    std::string identifier = fmt::format("com.test.soak.install{}", n);
    fs::path bundle = world_.apps / fmt::format("Install{}.app", n);
    writeApp(bundle, identifier);
    // Alternately through ekctl and by hand.
    bool added = false;
    if (n % 2) {
      auto result = daemon_.ekctl({"add", bundle.string()});
      added = result.status == 0;
      if (!added)
        problems_.add(fmt::format("ekctl add {} failed ({}): {}", bundle.string(), result.status,
                                  result.err));
    } else {
      auto reply = ask(request("add", {{"paths", Value(Array{Value(bundle.string())})}}));
      added = reply && replyErrorCode(*reply) == 0;
      if (!added)
        problems_.add("add of " + bundle.string() + ": " +
                      (reply ? reply->description() : "no reply"));
    }
    installed_.push_back({bundle, identifier});
    if (added) {
      ++counters_.installs;
      if (!waitListed(identifier + ".One", true))
        problems_.add("installed " + identifier + " is not listed");
    }
  }

  void uninstallOldest() {
    auto [bundle, identifier] = installed_.front();
    installed_.erase(installed_.begin());
    auto result = daemon_.ekctlAs(world_.ekctl, {"remove", bundle.string()});
    if (result.status != 0) {
      problems_.add(fmt::format("ekctl remove {} failed ({}): {}{}", bundle.string(), result.status,
                                result.out, result.err));
    } else {
      ++counters_.uninstalls;
      if (!waitListed(identifier + ".One", false))
        problems_.add("uninstalled " + identifier + " is still listed");
    }
    std::error_code ignored;
    fs::remove_all(bundle, ignored);
  }

  static std::vector<uint8_t> header(uint32_t length, uint32_t flags, uint64_t id) {
    std::vector<uint8_t> bytes(wyre::kHeaderSize);
    wyre::encodeHeader({length, flags, id}, bytes.data());
    return bytes;
  }

  void garbage() {
    auto kind = static_cast<Garbage>(nextGarbage_++ % static_cast<unsigned>(Garbage::Count));
    RawClient client(daemon_.socketPath());
    if (!client.connected()) return problems_.add("cannot connect to send garbage");
    std::vector<uint8_t> body =
        cbor::encode(request("find", {{"uuids", Value(world_.thumbsUuid)}}));
    std::vector<uint8_t> frame;
    // Whether the daemon must close the connection (true), may answer or close (false).
    bool mustClose = false;
    bool waitForOutcome = true;
    // Whether a request follows on the same connection, whose reply (or a hang-up) must come.
    bool followUp = false;
    switch (kind) {
      case Garbage::HugeLength:
        frame = header(0xffffffffu, wyre::kFlagWantsReply, 1);
        mustClose = true;
        break;
      case Garbage::JustOverMaximum:
        frame = header(wyre::kMaxBodySize + 1, wyre::kFlagWantsReply, 1);
        mustClose = true;
        break;
      case Garbage::NotCbor: {
        std::vector<uint8_t> junk(64, 0xff);
        frame = header(static_cast<uint32_t>(junk.size()), wyre::kFlagWantsReply, 1);
        frame.insert(frame.end(), junk.begin(), junk.end());
        break;
      }
      case Garbage::TruncatedFrame:
        frame = header(static_cast<uint32_t>(body.size()), wyre::kFlagWantsReply, 1);
        frame.insert(frame.end(), body.begin(), body.begin() + static_cast<long>(body.size() / 2));
        waitForOutcome = false;  // the daemon rightly waits for the rest; we hang up instead
        break;
      case Garbage::TruncatedCbor:
        frame = header(static_cast<uint32_t>(body.size() / 2), wyre::kFlagWantsReply, 1);
        frame.insert(frame.end(), body.begin(), body.begin() + static_cast<long>(body.size() / 2));
        break;
      case Garbage::UnknownFlags:
        frame = header(static_cast<uint32_t>(body.size()), 0xfffffff0u | wyre::kFlagWantsReply, 1);
        frame.insert(frame.end(), body.begin(), body.end());
        break;
      case Garbage::ReplyFlag:
        // Nothing asks for an answer: silence is as right as hanging up.
        frame = header(static_cast<uint32_t>(body.size()), wyre::kFlagReply, 1);
        frame.insert(frame.end(), body.begin(), body.end());
        followUp = true;
        break;
      case Garbage::DeepNesting: {
        std::vector<uint8_t> nested(100000, 0x81);
        nested.push_back(0x00);
        frame = header(static_cast<uint32_t>(nested.size()), wyre::kFlagWantsReply, 1);
        frame.insert(frame.end(), nested.begin(), nested.end());
        break;
      }
      case Garbage::EmptyBody:
        frame = header(0, wyre::kFlagWantsReply, 1);
        break;
      case Garbage::NotAMap: {
        // Dropped without an answer by design; the connection must go on serving.
        std::vector<uint8_t> number = cbor::encode(Value(uint64_t{42}));
        frame = header(static_cast<uint32_t>(number.size()), wyre::kFlagWantsReply, 1);
        frame.insert(frame.end(), number.begin(), number.end());
        followUp = true;
        break;
      }
      case Garbage::Count:
        return;
    }
    client.sendBytes(frame);
    ++counters_.garbageFrames;
    if (followUp) {
      client.sendMessage(request("bulk"), 2);
      bool served = false;
      for (int i = 0; i < 2 && !served; ++i) {
        auto next = client.readFrame(kSettleTimeout);
        if (!next) {
          if (!client.closedByPeer(milliseconds(0))) {
            problems_.add(
                fmt::format("after {} ekd neither answered the next request nor "
                            "closed the connection",
                            garbageName(kind)));
          }
          break;
        }
        served = next->id == 2;
      }
    } else if (waitForOutcome) {
      // An oversized frame can only be refused by closing the connection; any other request
      // that wants a reply gets one or a closed connection, never silence.
      auto start = Clock::now();
      bool closed = false;
      bool answered = false;
      while (Clock::now() - start < kSettleTimeout && !closed && !answered) {
        pollfd p{client.fd(), POLLIN, 0};
        if (poll(&p, 1, 100) <= 0) continue;
        char peek;
        if (recv(client.fd(), &peek, 1, MSG_PEEK) <= 0) {
          closed = true;
          continue;
        }
        auto frameRead = client.readFrame(milliseconds(5000));
        answered = true;
        if (mustClose) {
          problems_.add(fmt::format("ekd answered {}: {}", garbageName(kind),
                                    frameRead ? frameRead->body.description() : "(unreadable)"));
        }
      }
      if (!closed && !answered) {
        problems_.add(fmt::format("ekd neither answered nor closed a connection that sent {}",
                                  garbageName(kind)));
      }
    }
    expectAnswering(garbageName(kind));
  }

  // A connection that sends requests with large replies and never reads them.
  void topUpNonReader() {
    if (nonReader_ < 0) {
      nonReader_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
      sockaddr_un address{};
      address.sun_family = AF_UNIX;
      std::string path = daemon_.socketPath();
      std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
      if (connect(nonReader_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
        closeNonReader();
        return;
      }
      pending_.clear();
    }
    for (int i = 0; i < 16; ++i) {
      if (pending_.empty()) {
        wyre::appendFrame(pending_, request("match", {}), wyre::kFlagWantsReply, ++nonReaderId_);
        ++counters_.nonReaderRequests;
      }
      ssize_t n = send(nonReader_, pending_.data(), pending_.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
      if (n < 0) {
        if (errno == EAGAIN || errno == EWOULDBLOCK) return;  // the daemon stopped reading
        ++counters_.nonReaderClosed;                          // the daemon hung up on it
        closeNonReader();
        return;
      }
      pending_.erase(pending_.begin(), pending_.begin() + n);
    }
  }
  void closeNonReader() {
    if (nonReader_ >= 0) ::close(nonReader_);
    nonReader_ = -1;
  }

  EkdProcess& daemon_;
  const World& world_;
  Problems& problems_;
  Counters& counters_;
  std::mt19937_64 random_;
  std::atomic<bool> stop_{false};
  std::atomic<unsigned> rounds_{0};
  std::thread thread_;
  mutable std::mutex mutex_;
  std::vector<pid_t> deadHosts_;
  std::vector<std::pair<fs::path, std::string>> installed_;
  unsigned nextInstall_ = 0;
  unsigned nextGarbage_ = 0;
  int nonReader_ = -1;
  uint64_t nonReaderId_ = 0;
  std::vector<uint8_t> pending_;
};

// ---- The run -----------------------------------------------------------------------------------

struct Options {
  double seconds = 600;
  uint64_t seed = 0;
};

class Soak {
 public:
  explicit Soak(const Options& options) : options_(options), random_(options.seed) {
    daemon_.setEnvironment("EKORA_LOG", "default");
  }

  int run();

 private:
  bool setUp();
  bool startDaemon(const std::string& why);
  std::unique_ptr<Child> startBench(double duration);
  void finishBench(std::unique_ptr<Child> bench, bool daemonKilled, double duration);
  void checkAfterRestart(const std::string& when);
  void checkDeclarations(const std::string& when);
  void checkLog(const std::string& when);
  void checkEverythingListed();
  bool daemonRunning();
  std::optional<std::map<int, std::string>> settledDescriptors();
  uint64_t settledRss();
  bool terminateDaemon();
  std::optional<Uuid> uuidOf(const std::string& path);
  int report(Clock::time_point started, std::optional<uint64_t> rssBefore,
             std::optional<uint64_t> rssAfter, std::optional<size_t> fdsBefore,
             std::optional<size_t> fdsAfter, const Annotator* annotator = nullptr);
  void fatal(const std::string& what) { problems_.add(what); }

  Options options_;
  std::mt19937_64 random_;
  EkdProcess daemon_;
  World world_;
  Problems problems_;
  Counters counters_;
};

std::optional<Uuid> Soak::uuidOf(const std::string& path) {
  auto reply = daemon_.ask(request("find", {{"paths", Value("file://" + path)}}), kReplyTimeout);
  const Value* form = reply ? reply->get("matches") : nullptr;
  const std::string* uuid = form ? form->getString("uuid") : nullptr;
  if (!uuid) {
    problems_.add("no plug-in found at " + path + ": " +
                  (reply ? reply->description() : std::string("no reply")));
    return std::nullopt;
  }
  return Uuid::parse(*uuid);
}

bool Soak::daemonRunning() {
  if (!daemon_.running()) return false;
  siginfo_t info{};
  // WNOWAIT: EkdProcess reaps it.
  if (waitid(P_PID, static_cast<id_t>(daemon_.pid()), &info, WEXITED | WNOHANG | WNOWAIT) != 0) {
    return false;
  }
  return info.si_pid == 0;
}

bool Soak::startDaemon(const std::string& why) {
  if (!daemon_.start()) {
    fatal("ekd did not start (" + why + "); its log ends with:\n" +
          daemon_.log().substr(daemon_.log().size() > 4000 ? daemon_.log().size() - 4000 : 0));
    return false;
  }
  return true;
}

bool Soak::setUp() {
  world_.root = fs::canonical(daemon_.root().path());
  world_.apps = world_.root / "Applications";
  fs::create_directories(world_.apps);
  auto fixture = test::runCommand(
      {BENCH_FIXTURE_PATH, "plugins", "--system-root", (world_.root / "System").string(), "--count",
       std::to_string(kBenchPlugIns), "--points", std::to_string(kBenchPoints)});
  if (fixture.status != 0) {
    fatal("bench_fixture failed: " + fixture.err);
    return false;
  }
  for (const char* app : {"Viewer.app", "Notes.app"}) {
    fs::copy(fs::path(EXAMPLES_DIR) / "Applications" / app, world_.apps / app,
             fs::copy_options::recursive);
  }
  world_.viewer = (world_.apps / "Viewer.app").string();
  world_.notes = (world_.apps / "Notes.app").string();
  world_.churn = (world_.apps / "Churn.app").string();
  writeApp(world_.churn, "com.test.soak.churn");
  world_.viewerShare = world_.viewer + "/PlugIns/Share.appex";
  world_.notesShare = world_.notes + "/PlugIns/Share.appex";
  world_.thumbs = world_.viewer + "/PlugIns/Thumbs.appex";
  world_.ekctl = entitledCopy(test::ekctlPath(), world_.root / "bin");
  world_.ekbench = entitledCopy(EKBENCH_PATH, world_.root / "bin");

  if (!startDaemon("first start")) return false;
  auto added =
      daemon_.ask(request("add", {{"paths", Value(Array{Value(world_.viewer), Value(world_.notes),
                                                        Value(world_.churn)})}}),
                  kReplyTimeout);
  if (!added || replyErrorCode(*added) != 0) {
    fatal("adding the applications failed: " + (added ? added->description() : "no reply"));
    return false;
  }
  for (unsigned i = 0; i < kBenchPlugIns; ++i) {
    auto uuid = uuidOf(world_.benchPath(i));
    if (!uuid) return false;
    world_.bench.push_back(*uuid);
  }
  auto viewerShare = uuidOf(world_.viewerShare);
  auto notesShare = uuidOf(world_.notesShare);
  auto thumbs = uuidOf(world_.thumbs);
  if (!viewerShare || !notesShare || !thumbs) return false;
  world_.viewerShareUuid = *viewerShare;
  world_.notesShareUuid = *notesShare;
  world_.thumbsUuid = *thumbs;

  world_.requestsFile = (world_.root / "requests.jsonl").string();
  std::ofstream requests(world_.requestsFile);
  for (const Value& message : benchRequests(world_, random_)) {
    requests << wirejson::write(message) << "\n";
  }
  return static_cast<bool>(requests.flush());
}

std::unique_ptr<Child> Soak::startBench(double duration) {
  auto bench = Child::spawn(
      {world_.ekbench, "-S", daemon_.service(), "--connections", std::to_string(kConnections),
       "--duration", fmt::format("{:.3f}", duration), "--warmup", "0", "--timeout",
       std::to_string(kReplyTimeout.count() / 1000), "--requests", world_.requestsFile, "--json"},
      daemon_.environment(), (world_.root / "ekbench.log").string());
  if (!bench) fatal("cannot start ekbench");
  return bench;
}

void Soak::finishBench(std::unique_ptr<Child> bench, bool daemonKilled, double duration) {
  if (!bench) return;
  // ekbench ends by itself at its duration, or once every connection failed to reconnect.
  auto status = bench->wait(milliseconds(static_cast<int64_t>(duration * 1000)) + seconds(90));
  if (!status) {
    fatal("ekbench did not end in time");
    bench->kill9();
    return;
  }
  std::string out = bench->output();
  size_t brace = out.find('{');
  auto parsed = nlohmann::json::parse(
      brace == std::string::npos ? std::string("") : out.substr(brace), nullptr, false);
  if (parsed.is_discarded() || !parsed.contains("daemon")) {
    fatal(fmt::format("ekbench (status {}) printed no report: {}", *status, out));
    return;
  }
  const auto& daemon = parsed["daemon"];
  uint64_t requests = daemon.value("requests", uint64_t{0});
  uint64_t errors = daemon.value("error_replies", uint64_t{0});
  uint64_t failures = daemon.value("failures", uint64_t{0});
  counters_.requests += requests;
  counters_.errorReplies += errors;
  counters_.failures += failures;
  note(fmt::format("ekbench: {} requests, {} error replies (first: {}), {} failures (first: {}){}",
                   requests, errors, daemon.value("first_error", std::string()), failures,
                   daemon.value("first_failure", std::string()),
                   daemonKilled ? " (ekd killed during the run)" : ""));
  if (requests == 0) fatal("ekbench completed no request");
  if (!daemonKilled) {
    counters_.failuresWhileRunning += failures;
    if (failures != 0 || *status != 0) {
      fatal(fmt::format("ekbench saw {} transport failures with ekd running (status {}): {}",
                        failures, *status, daemon.value("first_failure", std::string())));
    }
  }
}

void Soak::checkDeclarations(const std::string& when) {
  std::error_code error;
  fs::path services = world_.root / "run/services";
  for (const auto& entry : fs::directory_iterator(services, error)) {
    std::string name = entry.path().filename().string();
    if (name.empty() || !std::all_of(name.begin(), name.end(), ::isdigit)) continue;
    pid_t pid = std::atoi(name.c_str());
    if (!processAlive(pid)) {
      problems_.add(fmt::format("{}: declarations of exited host {} remain in {}", when, pid,
                                entry.path().string()));
    }
  }
}

void Soak::checkLog(const std::string& when) {
  std::ifstream log(daemon_.root().path() / "ekd.log");
  static const char* kBad[] = {"(resetting)",      "moved aside",    "kept unusable",
                               "AddressSanitizer", "runtime error:", "LeakSanitizer"};
  unsigned reported = 0;
  for (std::string line; std::getline(log, line);) {
    for (const char* bad : kBad) {
      if (line.find(bad) != std::string::npos && reported++ < 5) {
        problems_.add(when + ": ekd logged: " + line);
      }
    }
  }
  std::error_code error;
  for (const auto& entry : fs::directory_iterator(world_.root / "state", error)) {
    std::string name = entry.path().filename().string();
    if (name.find(".corrupt-") != std::string::npos || name.find(".bad-") != std::string::npos) {
      problems_.add(when + ": a state file was set aside: " + name);
    }
  }
}

void Soak::checkAfterRestart(const std::string& when) {
  checkLog(when);
  checkDeclarations(when);
  // The registry came back: the plug-ins keep their UUIDs, and ekctl finds one.
  auto result = daemon_.ekctl({"find", "--uuid", world_.bench[kBenchPlugIns - 1].string()});
  if (result.status != 0 || result.out.find(kBenchPrefix) == std::string::npos) {
    problems_.add(fmt::format("{}: ekctl find failed ({}): {}{}", when, result.status, result.out,
                              result.err));
  }
}

void Soak::checkEverythingListed() {
  auto reply = daemon_.ask(request("match", {}), kReplyTimeout);
  const Array* matches = reply ? reply->getArray("matches") : nullptr;
  if (!matches) {
    problems_.add("final match failed: " + (reply ? reply->description() : "no reply"));
    return;
  }
  std::set<std::string> listed;
  for (const Value& form : *matches) {
    if (const std::string* id = form.getString("identifier")) listed.insert(*id);
  }
  std::vector<std::string> expected{kNotesShare, kViewerShare, "com.corvane.example.notes.action",
                                    "com.corvane.example.viewer.thumbs"};
  for (unsigned i = 0; i < kBenchPlugIns; ++i) expected.push_back(kBenchPrefix + std::to_string(i));
  for (const std::string& id : expected) {
    if (!listed.count(id))
      problems_.add("at the end " + id + " is not listed by match (a hold left behind?)");
  }
}

std::optional<std::map<int, std::string>> Soak::settledDescriptors() {
  // Closing a connection reaches the daemon asynchronously: the count is taken once it has
  // stayed the same for a second.
  auto deadline = Clock::now() + kSettleTimeout;
  auto last = descriptors(daemon_.pid());
  auto since = Clock::now();
  while (Clock::now() < deadline) {
    std::this_thread::sleep_for(milliseconds(100));
    auto current = descriptors(daemon_.pid());
    if (current.size() != last.size()) {
      last = std::move(current);
      since = Clock::now();
    } else if (Clock::now() - since >= seconds(1)) {
      return current;
    }
  }
  return std::nullopt;
}

uint64_t Soak::settledRss() {
  // An idle daemon gives freed heap back shortly after its last request: the figure is taken
  // once it has stayed the same for a second. Under a sanitizer it is only shown: no need to
  // wait for it.
  auto deadline = Clock::now() + (kCheckRss ? kSettleTimeout : milliseconds(500));
  uint64_t last = rssKiB(daemon_.pid()).value_or(0);
  auto since = Clock::now();
  while (Clock::now() < deadline && Clock::now() - since < seconds(1)) {
    std::this_thread::sleep_for(milliseconds(100));
    uint64_t current = rssKiB(daemon_.pid()).value_or(0);
    if (current != last) {
      last = current;
      since = Clock::now();
    }
  }
  return last;
}

bool Soak::terminateDaemon() {
  ::kill(daemon_.pid(), SIGTERM);
  auto deadline = Clock::now() + kSettleTimeout;
  while (daemonRunning() && Clock::now() < deadline) std::this_thread::sleep_for(milliseconds(20));
  if (daemonRunning()) {
    fatal("ekd did not exit within 20 s of SIGTERM");
    daemon_.kill9();
    return false;
  }
  int status = daemon_.terminate();
  if (status != 0) {
    fatal(fmt::format("ekd exited with status {} on SIGTERM", status));
    return false;
  }
  return true;
}

int Soak::run() {
  const auto started = Clock::now();
  // The traffic time: kill phases first, then the last lifetime of the daemon, whose first
  // third warms it up before the RSS and descriptors are recorded.
  const double total = options_.seconds;
  const unsigned killPhases = std::clamp(static_cast<unsigned>(total / 60), 2u, 10u);
  const double last = std::max(8.0, total * 0.45);
  const double warmup = std::max(4.0, last / 3);
  const double measured = last - warmup;
  const double killPhase = std::max(2.0, (total - last) / killPhases);
  note(
      fmt::format("seed {}, {:.0f} s of traffic: {} phases of {:.1f} s each ended by SIGKILL to "
                  "ekd, then {:.1f} s warm-up and {:.1f} s measured",
                  options_.seed, total, killPhases, killPhase, warmup, measured));

  try {
    if (!setUp()) return report(started, {}, {}, {}, {});
  } catch (const std::exception& e) {
    fatal(std::string("setting up: ") + e.what());
    return report(started, {}, {}, {}, {});
  }
  Annotator annotator(world_, problems_);
  Chaos chaos(daemon_, world_, problems_, counters_, random_());

  // Traffic, chaos and SIGKILL to the daemon in the middle of it all.
  for (unsigned phase = 1; phase <= killPhases && problems_.count() == 0; ++phase) {
    auto bench = startBench(killPhase + 120);
    annotator.start(daemon_.socketPath());
    chaos.start();
    auto end = Clock::now() + milliseconds(static_cast<int64_t>(killPhase * 1000));
    while (Clock::now() < end && daemonRunning()) std::this_thread::sleep_for(milliseconds(50));
    chaos.stop();
    if (!daemonRunning()) {
      fatal(fmt::format("ekd died by itself in phase {}", phase));
      annotator.stop();
      break;
    }
    std::this_thread::sleep_for(milliseconds(std::uniform_int_distribution<int>(0, 300)(random_)));
    daemon_.kill9();
    ++counters_.restarts;
    annotator.stop();
    finishBench(std::move(bench), true, killPhase + 120);
    if (!startDaemon(fmt::format("restart {}", phase))) break;
    std::string when = fmt::format("after SIGKILL {}", phase);
    annotator.verify(daemon_, when, false);
    checkAfterRestart(when);
    note(fmt::format("{}: {} annotations acknowledged so far, {} chaos rounds, {} clients killed",
                     when, annotator.acknowledged(), chaos.rounds(),
                     counters_.clientsKilled.load()));
  }

  std::optional<uint64_t> rssBefore, rssAfter;
  std::optional<size_t> fdsBefore, fdsAfter;
  if (problems_.count() == 0) {
    // Warm-up of the last lifetime: the same traffic, every chaos action at least once.
    auto bench = startBench(warmup);
    annotator.start(daemon_.socketPath());
    chaos.start();
    finishBench(std::move(bench), false, warmup);
    chaos.stop(true);
    annotator.stop();
    if (!daemonRunning()) fatal("ekd died during the warm-up");
  }
  std::map<int, std::string> baseline;
  if (problems_.count() == 0) {
    auto fds = settledDescriptors();
    if (!fds)
      fatal("ekd's descriptors did not settle after the warm-up");
    else
      baseline = *fds;
    fdsBefore = baseline.size();
    rssBefore = settledRss();
    note(fmt::format("after warm-up: RSS {} KiB, {} descriptors", *rssBefore, *fdsBefore));

    auto bench = startBench(measured);
    annotator.start(daemon_.socketPath());
    chaos.start();
    finishBench(std::move(bench), false, measured);
    chaos.stop(true);
    chaos.uninstallAll();
    annotator.stop();
    if (!daemonRunning()) fatal("ekd died during the measured run");
  }
  if (problems_.count() == 0 || (daemonRunning() && fdsBefore)) {
    // All clients are gone: the daemon must be back where the warm-up left it.
    auto deadline = Clock::now() + kSettleTimeout;
    std::map<int, std::string> fds = descriptors(daemon_.pid());
    while (fds.size() != baseline.size() && Clock::now() < deadline) {
      std::this_thread::sleep_for(milliseconds(100));
      fds = descriptors(daemon_.pid());
    }
    fdsAfter = fds.size();
    rssAfter = settledRss();
    if (*fdsAfter != *fdsBefore) {
      std::map<int, std::string> extra, missing;
      for (const auto& [fd, target] : fds) {
        if (!baseline.count(fd) || baseline[fd] != target) extra[fd] = target;
      }
      for (const auto& [fd, target] : baseline) {
        if (!fds.count(fd) || fds[fd] != target) missing[fd] = target;
      }
      problems_.add(fmt::format(
          "ekd has {} descriptors with no client, {} after the warm-up; new:{} gone:{}", *fdsAfter,
          *fdsBefore, describeDescriptors(extra), describeDescriptors(missing)));
    }
    if (kCheckRss &&
        *rssAfter > static_cast<uint64_t>(static_cast<double>(*rssBefore) * (1 + kRssTolerance))) {
      problems_.add(fmt::format(
          "ekd's RSS grew from {} KiB after the warm-up to {} KiB (+{:.1f}%, "
          "at most {:.0f}% allowed)",
          *rssBefore, *rssAfter, 100.0 * (static_cast<double>(*rssAfter) / *rssBefore - 1),
          kRssTolerance * 100));
    }

    // No hold outlived its client, no declaration outlived its host (a declaration written
    // now prunes those of hosts that exited), every acknowledged annotation is there.
    checkEverythingListed();
    auto ready = daemon_.ask(request("ready", {{"uuids", uuidArray({world_.viewerShareUuid})}}),
                             kReplyTimeout);
    if (!ready || replyErrorCode(*ready) != 0) {
      problems_.add("final ready failed: " + (ready ? ready->description() : "no reply"));
    }
    checkDeclarations("at the end");
    for (pid_t pid : chaos.deadHosts()) {
      if (fs::exists(world_.root / "run/services" / std::to_string(pid)) && !processAlive(pid)) {
        problems_.add(fmt::format("declarations of killed client {} remain", pid));
      }
    }
    annotator.verify(daemon_, "at the end", true);

    // The files load again after a clean stop, with nothing set aside.
    if (terminateDaemon() && startDaemon("the last restart")) {
      ++counters_.restarts;
      annotator.verify(daemon_, "after the last restart", true);
      checkAfterRestart("after the last restart");
      checkEverythingListed();
      terminateDaemon();
    }
  }
  return report(started, rssBefore, rssAfter, fdsBefore, fdsAfter, &annotator);
}

int Soak::report(Clock::time_point started, std::optional<uint64_t> rssBefore,
                 std::optional<uint64_t> rssAfter, std::optional<size_t> fdsBefore,
                 std::optional<size_t> fdsAfter, const Annotator* annotator) {
  auto text = [](auto value) { return value ? std::to_string(*value) : std::string("-"); };
  std::string rss = kCheckRss ? fmt::format("rss_kib={}->{}", text(rssBefore), text(rssAfter))
                              : fmt::format("rss_kib={}->{} (not judged under a sanitizer)",
                                            text(rssBefore), text(rssAfter));
  auto problems = problems_.list();
  double elapsed = std::chrono::duration<double>(Clock::now() - started).count();
  std::printf(
      "soak: %s in %.0f s (seed %llu): requests=%llu errors=%llu failures=%llu "
      "(with ekd up: %llu) clients_killed=%llu garbage_frames=%llu installs=%llu "
      "uninstalls=%llu restarts=%llu annotations_acked=%llu annotations_verified=%llu %s "
      "fds=%s->%s problems=%zu\n",
      problems.empty() ? "PASS" : "FAIL", elapsed, static_cast<unsigned long long>(options_.seed),
      static_cast<unsigned long long>(counters_.requests.load()),
      static_cast<unsigned long long>(counters_.errorReplies.load()),
      static_cast<unsigned long long>(counters_.failures.load()),
      static_cast<unsigned long long>(counters_.failuresWhileRunning.load()),
      static_cast<unsigned long long>(counters_.clientsKilled.load()),
      static_cast<unsigned long long>(counters_.garbageFrames.load()),
      static_cast<unsigned long long>(counters_.installs.load()),
      static_cast<unsigned long long>(counters_.uninstalls.load()),
      static_cast<unsigned long long>(counters_.restarts.load()),
      static_cast<unsigned long long>(annotator ? annotator->acknowledged() : 0),
      static_cast<unsigned long long>(annotator ? annotator->verified() : 0), rss.c_str(),
      text(fdsBefore).c_str(), text(fdsAfter).c_str(), problems.size());
  for (const std::string& problem : problems) std::printf("  problem: %s\n", problem.c_str());
  std::fflush(stdout);
  return problems.empty() ? 0 : 1;
}

// ---- The raw clients the chaos driver kills ---------------------------------------------------

// Prints one line and flushes it, so the driver sees it at once.
void say(const std::string& line) {
  std::printf("%s\n", line.c_str());
  std::fflush(stdout);
}

// Sends without reading, then waits to be killed (bounded, should the driver be gone).
[[noreturn]] void linger(RawClient& client, const std::vector<Value>& messages, uint64_t& id) {
  for (const Value& message : messages) client.sendMessage(message, ++id);
  say("sent");
  std::this_thread::sleep_for(seconds(120));
  std::_Exit(0);
}

int clientMode(int argc, char** argv) {
  if (argc < 4) return 2;
  std::string mode = argv[2];
  RawClient client(argv[3]);
  if (!client.connected()) {
    say("connect failed");
    return 1;
  }
  uint64_t id = 0;
  auto answer = [&](const Value& message) -> std::string {
    if (!client.sendMessage(message, ++id)) return "send failed";
    auto frame = client.readFrame(kReplyTimeout);
    if (!frame) return "no reply";
    return std::to_string(replyErrorCode(frame->body));
  };
  Value everything = request("match", {});
  if (mode == "hold" && argc >= 5) {
    say("held " + answer(request("lock", {{"paths", Value(Array{Value(argv[4])})},
                                          {"flags", Value(uint64_t{0})}})));
    linger(client, {everything}, id);
  }
  if (mode == "ready" && argc >= 5) {
    auto uuid = Uuid::parse(argv[4]);
    if (!uuid) return 2;
    say("ready " + answer(request("ready", {{"uuids", uuidArray({*uuid})}})));
    linger(client, {everything, everything}, id);
  }
  if (mode == "burst" && argc >= 6) {
    auto ready = Uuid::parse(argv[4]);
    auto other = Uuid::parse(argv[5]);
    if (!ready || !other) return 2;
    std::vector<Value> messages;
    for (int i = 0; i < 8; ++i) {
      messages.push_back(request("ready", {{"uuids", uuidArray({*ready})}}));
      messages.push_back(request("find", {{"uuids", Value(*other)}}));
      messages.push_back(everything);
      messages.push_back(request(
          "annotate", {{"annotations",
                        Value(Dictionary{{"extension", Value(Dictionary{{"burst", Value(i)}})}})},
                       {"uuids", uuidArray({*other})}}));
      messages.push_back(request("access", {{"uuids", uuidArray({*other})}}));
      messages.push_back(request("bulk-annotate", {{"annotations", Value(Dictionary{})}}));
    }
    linger(client, messages, id);
  }
  return 2;
}

}  // namespace
}  // namespace ek::soak

int main(int argc, char** argv) {
  using namespace ek::soak;
  if (argc >= 2 && std::strcmp(argv[1], "--client") == 0) return clientMode(argc, argv);
  ::signal(SIGPIPE, SIG_IGN);
  Options options;
  if (const char* env = std::getenv("EKORA_SOAK_SECONDS")) options.seconds = std::atof(env);
  options.seed = std::random_device()();
  for (int i = 1; i < argc; ++i) {
    std::string arg = argv[i];
    if (arg == "--duration" && i + 1 < argc) {
      options.seconds = std::atof(argv[++i]);
    } else if (arg == "--seed" && i + 1 < argc) {
      options.seed = std::strtoull(argv[++i], nullptr, 10);
    } else {
      std::fprintf(stderr, "usage: ekora_soak [--duration SECONDS] [--seed N]\n");
      return 2;
    }
  }
  if (!(options.seconds >= 10 && options.seconds <= 24 * 3600)) {
    std::fprintf(stderr, "ekora_soak: the duration must be between 10 s and a day\n");
    return 2;
  }
  Soak soak(options);
  return soak.run();
}
