// ekbench: closed-loop load generator for Wyre services, with an echo baseline measured in the
// same process so that every figure can be read as a ratio to the bare socket round trip.

#include <fmt/format.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <iostream>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <system_error>
#include <vector>

#include "Ekora/EkProtocol.h"
#include "bench/EchoServer.h"
#include "bench/FrameIo.h"
#include "bench/LeanEcho.h"
#include "bench/LoadGenerator.h"
#include "platform/cbor/Cbor.h"
#include "platform/json/WireJson.h"
#include "platform/paths/Directories.h"
#include "platform/wyre/Wyre.h"

namespace {

using ek::bench::LoadOptions;
using ek::bench::LoadResult;

constexpr int kSuccess = 0;
constexpr int kUntrustworthy = 1;  // failures, or a run that completed no request
constexpr int kUsage = 2;
constexpr int kSetupFailed = 3;

// With --count alone the run still ends by itself.
constexpr double kCountTimeLimitSeconds = 600;
// Bounds of a --requests file: lines, bytes per line, bytes in all.
constexpr size_t kMaxRequestLines = size_t{1} << 20;
constexpr size_t kMaxRequestLineBytes = 64 * 1024;
constexpr size_t kMaxRequestFileBytes = size_t{256} << 20;
// Used by --echo-self-test when no request is given: a typical small request map.
constexpr const char* kSelfTestRequest =
    R"({"request":"find","version":3,"flags":0,"uuids":{"$uuid":"E621E1F8-C36C-495A-93FC-0C247A3E6E5F"},"paths":"/opt/Bench.app","environment":{}})";

struct Options {
  std::string service;
  std::string socket;
  unsigned connections = 1;
  double duration = 5;
  uint64_t count = 0;
  double warmup = 0.5;
  double timeout = 5;
  unsigned rounds = 0;
  bool baseline = false;
  bool echoSelfTest = false;
  bool json = false;
  bool encodeReply = false;
  bool decodeReplies = false;
  bool waitInRecv = false;
  bool lean = false;
  int daemonPid = 0;
  std::string request;
  std::string requestsFile;
};

// The encoded requests, and what the report says about them.
struct Requests {
  std::vector<std::vector<uint8_t>> bodies;
  size_t smallest = 0;
  size_t largest = 0;

  std::string describe(const Options& options) const {
    if (bodies.size() == 1) return fmt::format("request of {} bytes (CBOR)", largest);
    return fmt::format("{} requests of {} to {} bytes (CBOR) from {}", bodies.size(), smallest,
                       largest, options.requestsFile);
  }
};

struct Runs {
  enum class Kind { Socket, Encode, Lean };
  Kind kind = Kind::Socket;
  std::string label;
  std::string socket;
  std::vector<LoadResult> rounds;
};

bool trustworthy(const LoadResult& run) {
  return run.failures == 0 && run.requests > 0;
}

double ratio(double a, double b) {
  return b > 0 ? a / b : 0;
}

nlohmann::ordered_json toJson(const LoadResult& run) {
  ek::bench::LatencySummary latency = run.latency();
  nlohmann::ordered_json out;
  out["requests"] = run.requests;
  out["seconds"] = run.seconds;
  out["requests_per_second"] = run.requestsPerSecond();
  out["latency_us"] = {{"p50", latency.p50},
                       {"p90", latency.p90},
                       {"p99", latency.p99},
                       {"max", latency.max},
                       {"mean", latency.mean}};
  if (std::optional<double> cpu = run.cpuMicrosPerRequest()) out["cpu_us_per_request"] = *cpu;
  out["error_replies"] = run.errorReplies;
  out["failures"] = run.failures;
  if (!run.firstError.empty()) out["first_error"] = run.firstError;
  if (!run.firstFailure.empty()) out["first_failure"] = run.firstFailure;
  return out;
}

std::string row(const std::string& name, const LoadResult& run) {
  ek::bench::LatencySummary l = run.latency();
  std::optional<double> cpu = run.cpuMicrosPerRequest();
  return fmt::format(
      "{:<12} {:>10} {:>8.2f} {:>10.0f} {:>9.1f} {:>9.1f} {:>9.1f} {:>9.1f} {:>9} {:>7} {:>8}\n",
      name, run.requests, run.seconds, run.requestsPerSecond(), l.p50, l.p90, l.p99, l.max,
      cpu ? fmt::format("{:.1f}", *cpu) : std::string("-"), run.errorReplies, run.failures);
}

void printReadable(const Options& options, const Requests& requests, const std::vector<Runs>& all) {
  std::string bound =
      options.count ? fmt::format("{} requests (at most {:.0f} s)", options.count, options.duration)
                    : fmt::format("{:.1f} s", options.duration);
  fmt::print(
      "ekbench: {} connection{}, {} measured after {:.1f} s warm-up, {} round{}, {}; latencies "
      "in µs\n",
      options.connections, options.connections == 1 ? "" : "s", bound, options.warmup,
      options.rounds, options.rounds == 1 ? "" : "s", requests.describe(options));
  for (const Runs& runs : all) fmt::print("{:<12} {}\n", runs.label, runs.socket);
  fmt::print("{:<12} {:>10} {:>8} {:>10} {:>9} {:>9} {:>9} {:>9} {:>9} {:>7} {:>8}\n", "run",
             "requests", "seconds", "req/s", "p50", "p90", "p99", "max", "cpu/req", "errors",
             "failures");
  for (size_t round = 0; round < options.rounds; ++round) {
    for (const Runs& runs : all) {
      fmt::print("{}", row(fmt::format("{} #{}", runs.label, round + 1), runs.rounds[round]));
    }
  }
  if (options.rounds > 1) {
    for (const Runs& runs : all) {
      fmt::print("{}", row(runs.label + " all", ek::bench::combine(runs.rounds)));
    }
  }
  for (size_t a = 0; a < all.size(); ++a) {
    for (size_t b = a + 1; b < all.size(); ++b) {
      LoadResult x = ek::bench::combine(all[a].rounds);
      LoadResult y = ek::bench::combine(all[b].rounds);
      fmt::print("{} / {}: p50 {:.2f}x, req/s {:.2f}x\n", all[a].label, all[b].label,
                 ratio(x.latency().p50, y.latency().p50),
                 ratio(x.requestsPerSecond(), y.requestsPerSecond()));
    }
  }
  for (const Runs& runs : all) {
    LoadResult sum = ek::bench::combine(runs.rounds);
    if (!sum.firstError.empty()) {
      fmt::print("{}: first error reply: {}\n", runs.label, sum.firstError);
    }
    if (!sum.firstFailure.empty())
      fmt::print("{}: first failure: {}\n", runs.label, sum.firstFailure);
  }
}

void printJson(const Options& options, const Requests& requests, const std::vector<Runs>& all) {
  nlohmann::ordered_json out;
  out["connections"] = options.connections;
  out["duration_s"] = options.duration;
  out["warmup_s"] = options.warmup;
  if (options.count) out["count"] = options.count;
  out["rounds"] = options.rounds;
  if (requests.bodies.size() == 1) {
    out["request_bytes"] = requests.largest;
  } else {
    out["requests_file"] = options.requestsFile;
    out["request_count"] = requests.bodies.size();
    out["request_bytes"] = {{"min", requests.smallest}, {"max", requests.largest}};
  }
  for (const Runs& runs : all) {
    nlohmann::ordered_json entry = toJson(ek::bench::combine(runs.rounds));
    entry["socket"] = runs.socket;
    nlohmann::ordered_json rounds = nlohmann::ordered_json::array();
    for (const LoadResult& run : runs.rounds) rounds.push_back(toJson(run));
    entry["runs"] = std::move(rounds);
    out[runs.label] = std::move(entry);
  }
  nlohmann::ordered_json ratios;
  for (size_t a = 0; a < all.size(); ++a) {
    for (size_t b = a + 1; b < all.size(); ++b) {
      LoadResult x = ek::bench::combine(all[a].rounds);
      LoadResult y = ek::bench::combine(all[b].rounds);
      ratios[all[a].label + "/" + all[b].label] = {
          {"p50", ratio(x.latency().p50, y.latency().p50)},
          {"requests_per_second", ratio(x.requestsPerSecond(), y.requestsPerSecond())}};
    }
  }
  if (!ratios.empty()) out["ratios"] = std::move(ratios);
  std::cout << out.dump() << "\n";
}

std::optional<std::string> readRequestText(const Options& options) {
  if (options.request == "-") {
    // Bounded: a request larger than a frame may carry is refused after parsing anyway.
    std::string text;
    char chunk[65536];
    while (text.size() <= ek::wyre::kMaxBodySize * 2 &&
           std::cin.read(chunk, sizeof(chunk)).gcount() > 0) {
      text.append(chunk, static_cast<size_t>(std::cin.gcount()));
    }
    return text;
  }
  if (!options.request.empty()) return options.request;
  if (options.echoSelfTest) return std::string(kSelfTestRequest);
  return std::nullopt;
}

// Parses and encodes one request; the error says what is wrong with it.
ek::Result<std::vector<uint8_t>> encodeRequest(std::string_view text) {
  ek::Result<ek::Value> request = ek::wirejson::parse(text);
  if (!request) return request.error();
  std::vector<uint8_t> body = ek::cbor::encode(*request);
  if (body.size() > ek::wyre::kMaxBodySize) {
    return ek::EkError::posix(EMSGSIZE, "the request is larger than a frame may carry");
  }
  return body;
}

void add(Requests& requests, std::vector<uint8_t> body) {
  requests.smallest =
      requests.bodies.empty() ? body.size() : std::min(requests.smallest, body.size());
  requests.largest = std::max(requests.largest, body.size());
  requests.bodies.push_back(std::move(body));
}

// One request in wire JSON per line; empty lines are skipped.
ek::Result<Requests> readRequestsFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return ek::EkError::fromErrno(errno, "opening " + path);
  Requests requests;
  std::string line;
  size_t number = 0;
  size_t total = 0;
  for (;;) {
    line.clear();
    char c;
    while (in.get(c) && c != '\n') {
      if (line.size() == kMaxRequestLineBytes) {
        return ek::EkError::posix(EMSGSIZE, fmt::format("{}:{}: a line longer than {} bytes", path,
                                                        number + 1, kMaxRequestLineBytes));
      }
      line += c;
    }
    if (line.empty() && !in) break;
    ++number;
    total += line.size() + 1;
    if (total > kMaxRequestFileBytes) {
      return ek::EkError::posix(EFBIG,
                                fmt::format("{}: more than {} bytes", path, kMaxRequestFileBytes));
    }
    if (!line.empty() && line.back() == '\r') line.pop_back();
    if (line.empty()) continue;
    if (requests.bodies.size() == kMaxRequestLines) {
      return ek::EkError::posix(E2BIG,
                                fmt::format("{}: more than {} requests", path, kMaxRequestLines));
    }
    ek::Result<std::vector<uint8_t>> body = encodeRequest(line);
    if (!body) {
      return ek::EkError::posix(EINVAL,
                                fmt::format("{}:{}: {}", path, number, body.error().message));
    }
    add(requests, std::move(body).value());
  }
  if (in.bad()) return ek::EkError::posix(EIO, "reading " + path);
  if (requests.bodies.empty()) return ek::EkError::posix(EINVAL, path + ": no request in it");
  return requests;
}

// The daemon's reply to body, asked for once on a connection of its own.
ek::Result<ek::Value> fetchReply(const std::string& socket, const std::vector<uint8_t>& body,
                                 const Options& options) {
  int fd = ek::bench::connectUnix(socket);
  if (fd < 0) return ek::EkError::fromErrno(errno, "connecting to " + socket);
  std::vector<uint8_t> frame(ek::wyre::kHeaderSize);
  frame.insert(frame.end(), body.begin(), body.end());
  ek::wyre::encodeHeader({static_cast<uint32_t>(body.size()), ek::wyre::kFlagWantsReply, 1},
                         frame.data());
  ek::bench::FrameReader reader;
  ek::wyre::FrameHeader header;
  std::span<const uint8_t> bytes;
  auto timeout = std::chrono::milliseconds(static_cast<int64_t>(options.timeout * 1000));
  bool answered = ek::bench::setIoTimeout(fd, timeout) &&
                  ek::bench::writeAll(fd, frame.data(), frame.size()) &&
                  reader.next(fd, header, bytes) == ek::bench::FrameReader::Status::Frame;
  ek::Result<ek::Value> reply = answered
                                    ? ek::cbor::decode(bytes)
                                    : ek::Result<ek::Value>(ek::EkError::posix(
                                          EIO, "no reply to the first request from " + socket));
  ::close(fd);
  return reply;
}

// Encodes reply again and again with the daemon's own encoder for as long as a measured run
// lasts: the floor under a request whose reply is large, such as a match of hundreds of forms.
LoadResult timeEncoding(const ek::Value& reply, const Options& options) {
  using Clock = std::chrono::steady_clock;
  LoadResult result;
  size_t bytes = 0;
  Clock::time_point start = Clock::now();
  Clock::time_point end =
      start + std::chrono::duration_cast<Clock::duration>(ek::bench::Seconds(options.duration));
  for (Clock::time_point now = start; now < end;) {
    // A fresh buffer each time, as the daemon's every reply needs one.
    bytes += ek::cbor::encode(reply).size();
    Clock::time_point done = Clock::now();
    result.latenciesNs.push_back(static_cast<uint64_t>(
        std::chrono::duration_cast<std::chrono::nanoseconds>(done - now).count()));
    ++result.requests;
    now = done;
  }
  result.seconds = ek::bench::Seconds(Clock::now() - start).count();
  if (bytes == 0) ++result.failures;
  return result;
}

// The floor: the blocking C client against the blocking C server, the same body.
LoadResult runLean(const char* path, const std::vector<uint8_t>& body, const Options& options) {
  LoadResult result;
  lean_echo_result lean;
  if (lean_echo_run(path, options.connections, options.warmup, options.duration, body.data(),
                    body.size(), &lean) != 0) {
    result.failures = 1;
    result.firstFailure = std::error_code(errno, std::generic_category()).message();
    return result;
  }
  result.requests = lean.requests;
  result.failures = lean.failures;
  if (lean.failures) result.firstFailure = "a connection broke";
  result.seconds = lean.seconds;
  result.latenciesNs.assign(lean.latencies_ns, lean.latencies_ns + lean.requests);
  lean_echo_result_free(&lean);
  return result;
}

}  // namespace

int main(int argc, char** argv) {
  Options options;
  CLI::App app{"ekbench: closed-loop load generator for a Wyre service"};
  auto* service = app.add_option("-S", options.service, "service name (default: the daemon's)");
  auto* socket = app.add_option("--socket", options.socket, "path of the Unix socket to load");
  socket->excludes(service);
  app.add_option("--connections", options.connections, "concurrent connections, one thread each")
      ->check(CLI::Range(1u, 1024u));
  auto* duration =
      app.add_option("--duration", options.duration, "seconds measured per run (default 5)")
          ->check(CLI::Range(0.001, 3600.0));
  app.add_option("--count", options.count, "total requests per run instead of a duration")
      ->check(CLI::Range(uint64_t{1}, uint64_t{1} << 40));
  app.add_option("--warmup", options.warmup, "seconds of unmeasured traffic first (default 0.5)")
      ->check(CLI::Range(0.0, 600.0));
  app.add_option("--timeout", options.timeout, "seconds to wait for one reply (default 5)")
      ->check(CLI::Range(0.001, 600.0));
  app.add_option("--rounds", options.rounds,
                 "runs of each target, alternated (default 2 with --baseline, else 1)")
      ->check(CLI::Range(1u, 20u));
  auto* baseline = app.add_flag("--baseline", options.baseline,
                                "also measure an in-process echo server and print the ratios");
  auto* selfTest = app.add_flag("--echo-self-test", options.echoSelfTest,
                                "measure only the in-process echo server");
  selfTest->excludes(baseline)->excludes(service)->excludes(socket);
  app.add_flag("--encode-reply", options.encodeReply,
               "also time encoding the daemon's reply to the first request, alone, and print "
               "the daemon's ratio to it")
      ->excludes(baseline)
      ->excludes(selfTest);
  app.add_flag("--decode-replies", options.decodeReplies,
               "build every reply whole in the value model, as a client would; by default only "
               "a reply's error members are built and the rest is only checked");
  app.add_flag("--wait-in-recv", options.waitInRecv,
               "let each connection wait for its reply asleep in recv instead of waiting for "
               "readiness as the client library's event loop does");
  app.add_flag("--lean", options.lean,
               "also measure the floor: a blocking C client against a blocking C echo server, "
               "in the same alternating rounds (duration-bounded)");
  app.add_option("--daemon-pid", options.daemonPid,
                 "report this process's CPU time per request (utime + stime) beside the "
                 "daemon's figures")
      ->check(CLI::Range(1, 1 << 30));
  app.add_flag("--json", options.json, "print one JSON object");
  auto* requestsFile = app.add_option(
      "--requests", options.requestsFile,
      "a file of requests in wire JSON, one per line, sent in turn (each connection starting "
      "at a different one)");
  app.add_option("REQUEST_JSON", options.request, "the request in wire JSON, or - for stdin")
      ->excludes(requestsFile);
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    int code = app.exit(e);
    return code == 0 ? kSuccess : kUsage;
  }
  if (options.count && duration->count() == 0) options.duration = kCountTimeLimitSeconds;
  if (options.rounds == 0) options.rounds = options.baseline || options.lean ? 2 : 1;

  Requests requests;
  if (!options.requestsFile.empty()) {
    ek::Result<Requests> read = readRequestsFile(options.requestsFile);
    if (!read) {
      std::fprintf(stderr, "ekbench: %s\n", read.error().message.c_str());
      return kUsage;
    }
    requests = std::move(read).value();
  } else {
    std::optional<std::string> text = readRequestText(options);
    if (!text) {
      std::fprintf(stderr, "ekbench: a request in wire JSON is needed\n");
      return kUsage;
    }
    ek::Result<std::vector<uint8_t>> body = encodeRequest(*text);
    if (!body) {
      std::fprintf(stderr, "ekbench: invalid request: %s\n", body.error().message.c_str());
      return kUsage;
    }
    add(requests, std::move(body).value());
  }
  if (!options.service.empty() && !ek::wyre::isValidServiceName(options.service)) {
    std::fprintf(stderr, "ekbench: invalid service name: %s\n", options.service.c_str());
    return kUsage;
  }

  std::vector<Runs> all;
  if (!options.echoSelfTest) {
    std::string path = !options.socket.empty() ? options.socket
                       : !options.service.empty()
                           ? ek::paths::servicePath(options.service)
                           : ek::paths::servicePath(ek::protocol::kServiceName);
    all.push_back({Runs::Kind::Socket, "daemon", path, {}});
  }
  std::unique_ptr<ek::bench::EchoServer> echo;
  if (options.baseline || options.echoSelfTest) {
    auto started = ek::bench::EchoServer::start();
    if (!started) {
      std::fprintf(stderr, "ekbench: echo server: %s\n", started.error().message.c_str());
      return kSetupFailed;
    }
    echo = std::move(started).value();
    all.push_back({Runs::Kind::Socket, "echo", echo->socketPath(), {}});
  }
  std::unique_ptr<lean_echo_server, void (*)(lean_echo_server*)> lean(nullptr,
                                                                      lean_echo_server_stop);
  if (options.lean) {
    lean.reset(lean_echo_server_start());
    if (!lean) {
      std::fprintf(stderr, "ekbench: lean echo server: %s\n", std::strerror(errno));
      return kSetupFailed;
    }
    all.push_back({Runs::Kind::Lean, "lean", lean_echo_server_path(lean.get()), {}});
  }

  std::optional<ek::Value> reply;
  if (options.encodeReply) {
    ek::Result<ek::Value> fetched = fetchReply(all[0].socket, requests.bodies[0], options);
    if (!fetched) {
      std::fprintf(stderr, "ekbench: %s\n", fetched.error().message.c_str());
      return kSetupFailed;
    }
    reply = std::move(fetched).value();
    all.push_back({Runs::Kind::Encode,
                   "encode",
                   fmt::format("the reply to the first request, {} bytes of CBOR",
                               ek::cbor::encode(*reply).size()),
                   {}});
  }

  // Alternating the targets spreads the machine's drift over both of them.
  for (unsigned round = 0; round < options.rounds; ++round) {
    for (Runs& runs : all) {
      if (runs.kind == Runs::Kind::Encode) {
        runs.rounds.push_back(timeEncoding(*reply, options));
        continue;
      }
      if (runs.kind == Runs::Kind::Lean) {
        runs.rounds.push_back(runLean(runs.socket.c_str(), requests.bodies[0], options));
        continue;
      }
      LoadOptions load;
      load.socketPath = runs.socket;
      load.connections = options.connections;
      load.warmup = ek::bench::Seconds(options.warmup);
      load.duration = ek::bench::Seconds(options.duration);
      if (options.count) load.count = options.count;
      load.decodeReplies = options.decodeReplies;
      load.waitInRecv = options.waitInRecv;
      if (options.daemonPid && runs.label == "daemon") load.cpuOfPid = options.daemonPid;
      load.replyTimeout = std::chrono::milliseconds(
          std::max<int64_t>(1, static_cast<int64_t>(options.timeout * 1000)));
      ek::Result<LoadResult> result =
          ek::bench::runLoad(load, std::span<const std::vector<uint8_t>>(requests.bodies));
      if (!result) {
        std::fprintf(stderr, "ekbench: %s\n", result.error().message.c_str());
        return kSetupFailed;
      }
      runs.rounds.push_back(std::move(result).value());
    }
  }

  if (options.json) {
    printJson(options, requests, all);
  } else {
    printReadable(options, requests, all);
  }

  int status = kSuccess;
  for (const Runs& runs : all) {
    LoadResult sum = ek::bench::combine(runs.rounds);
    for (const LoadResult& run : runs.rounds) {
      if (!trustworthy(run)) status = kUntrustworthy;
    }
    if (sum.errorReplies > 0) {
      std::fprintf(stderr,
                   "ekbench: warning: %llu of %llu replies from %s carried an errorcode (%s); "
                   "the figures measure the error path\n",
                   static_cast<unsigned long long>(sum.errorReplies),
                   static_cast<unsigned long long>(sum.requests), runs.label.c_str(),
                   sum.firstError.c_str());
    }
  }
  if (status != kSuccess) {
    std::fprintf(stderr, "ekbench: a run had transport failures or completed no request\n");
  }
  return status;
}
