// lock_bench: latency of the daemon's "lock" request holding one plug-in, against the echo
// round trip of the same request measured in the same run. Each hold is released (untimed)
// before the next is placed, so every round finds the daemon in the same state.
//
//   lock_bench --socket PATH --plugin BUNDLE_PATH [--count N] [--terminate IDENTIFIER]
//       holds the plug-in at BUNDLE_PATH N times. With --terminate, an instance of the plug-in
//       IDENTIFIER (a child of this process, declared for it and launched through the service
//       manager of $EKORA_RUNTIME_DIR) is started before each hold, and the lock asks the daemon
//       to end busy plug-ins: the reply comes once that instance is gone.

#include <fmt/format.h>
#include <sys/wait.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <string>
#include <vector>

#include "bench/EchoServer.h"
#include "bench/FrameIo.h"
#include "bench/LoadGenerator.h"
#include "platform/cbor/Cbor.h"
#include "platform/stard/ServiceManager.h"
#include "platform/value/Value.h"

namespace {

using Clock = std::chrono::steady_clock;
using ek::Array;
using ek::Dictionary;
using ek::Value;

constexpr int kSuccess = 0;
constexpr int kFailed = 1;
constexpr int kUsage = 2;
// The lock request's flags: the paths name plug-ins, and busy ones are ended first.
constexpr uint64_t kPlugInPaths = 0x1;
constexpr uint64_t kTerminateBusy = 0x4;
constexpr auto kReplyTimeout = std::chrono::seconds(30);

int failed(const std::string& what) {
  std::fprintf(stderr, "lock_bench: %s\n", what.c_str());
  return kFailed;
}

// One request and its reply on a blocking connection.
class Connection {
 public:
  explicit Connection(const std::string& socket) : fd_(ek::bench::connectUnix(socket)) {
    if (fd_ >= 0) ek::bench::setIoTimeout(fd_, kReplyTimeout);
  }
  ~Connection() {
    if (fd_ >= 0) ::close(fd_);
  }
  bool connected() const { return fd_ >= 0; }

  ek::Result<Value> ask(const Value& request) {
    std::vector<uint8_t> frame;
    ek::wyre::appendFrame(frame, request, ek::wyre::kFlagWantsReply, ++id_);
    if (!ek::bench::writeAll(fd_, frame.data(), frame.size())) {
      return ek::EkError::fromErrno(errno, "sending a request");
    }
    ek::wyre::FrameHeader header;
    std::span<const uint8_t> body;
    if (reader_.next(fd_, header, body) != ek::bench::FrameReader::Status::Frame ||
        header.id != id_) {
      return ek::EkError::posix(EIO, "no reply to a request");
    }
    return ek::cbor::decode(body);
  }

 private:
  int fd_;
  uint64_t id_ = 0;
  ek::bench::FrameReader reader_;
};

Value request(std::string_view name, Dictionary fields) {
  fields.emplace("request", Value(std::string(name)));
  fields.emplace("version", Value(uint64_t{3}));
  return Value(std::move(fields));
}

std::string replyError(const Value& reply) {
  const uint64_t* code = reply.getUnsigned("errorcode");
  if (code == nullptr || *code == 0) return {};
  const std::string* text = reply.getString("error");
  return fmt::format("error {}: {}", *code, text ? *text : "");
}

double p50Us(std::vector<uint64_t> latenciesNs) {
  std::sort(latenciesNs.begin(), latenciesNs.end());
  return static_cast<double>(ek::bench::percentile(latenciesNs, 0.5)) / 1000;
}

double p90Us(std::vector<uint64_t> latenciesNs) {
  std::sort(latenciesNs.begin(), latenciesNs.end());
  return static_cast<double>(ek::bench::percentile(latenciesNs, 0.9)) / 1000;
}

}  // namespace

int main(int argc, char** argv) {
  std::string socket;
  std::string plugIn;
  std::string terminate;
  unsigned count = 200;
  CLI::App app{"lock_bench: latency of holding one plug-in"};
  app.add_option("--socket", socket, "the daemon's socket")->required();
  app.add_option("--plugin", plugIn, "path of the plug-in bundle to hold")->required();
  app.add_option("--count", count, "holds placed (default 200)")->check(CLI::Range(1u, 100000u));
  app.add_option("--terminate", terminate,
                 "bundle identifier of that plug-in: run an instance before each hold and have "
                 "the daemon end it");
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    int code = app.exit(e);
    return code == 0 ? kSuccess : kUsage;
  }

  const uint64_t flags = kPlugInPaths | (terminate.empty() ? 0 : kTerminateBusy);
  const Value lock = request("lock", {{"paths", Value(Array{Value(plugIn)})}, {"flags", flags}});
  ek::stard::FileServiceManager manager;

  Connection daemon(socket);
  if (!daemon.connected()) return failed("cannot connect to " + socket);
  std::vector<uint64_t> latenciesNs;
  for (unsigned i = 0; i < count; ++i) {
    pid_t instance = -1;
    if (!terminate.empty()) {
      // Ending a plug-in's instances removes its declarations too: declare it again each time.
      if (manager.addExternalService(getpid(), "/bench", terminate, "/bin/sleep", {}) != 0) {
        return failed("cannot declare " + terminate + " in " + manager.runtimeDirectory());
      }
      ek::Result<pid_t> launched = manager.launch(getpid(), terminate, {"600"});
      if (!launched) return failed("launching " + terminate + ": " + launched.error().message);
      instance = *launched;
    }
    Clock::time_point sent = Clock::now();
    ek::Result<Value> reply = daemon.ask(lock);
    Clock::time_point received = Clock::now();
    if (instance > 0) {
      // The daemon has signalled the instance before it answers; anything else is a fault.
      kill(instance, SIGKILL);
      int status = 0;
      waitpid(instance, &status, 0);
      if (reply && !(WIFSIGNALED(status) && WTERMSIG(status) == SIGTERM)) {
        return failed("the daemon answered before ending the busy instance");
      }
    }
    if (!reply) return failed(reply.error().message);
    if (std::string error = replyError(*reply); !error.empty()) return failed("lock: " + error);
    const Value* hold = reply->get("uuids");
    if (hold == nullptr) return failed("lock: a reply without its hold");
    ek::Result<Value> released = daemon.ask(request("lock", {{"uuids", Value(Array{*hold})}}));
    if (!released) return failed(released.error().message);
    if (std::string error = replyError(*released); !error.empty()) {
      return failed("release: " + error);
    }
    latenciesNs.push_back(static_cast<uint64_t>(
        std::chrono::duration_cast<std::chrono::nanoseconds>(received - sent).count()));
  }

  auto echo = ek::bench::EchoServer::start();
  if (!echo) return failed("echo server: " + echo.error().message);
  ek::bench::LoadOptions load;
  load.socketPath = (*echo)->socketPath();
  load.count = count;
  load.warmup = ek::bench::Seconds(0.1);
  std::vector<uint8_t> body = ek::cbor::encode(lock);
  ek::Result<ek::bench::LoadResult> baseline = ek::bench::runLoad(load, body);
  if (!baseline) return failed("echo: " + baseline.error().message);
  double echoP50 = baseline->latency().p50;

  double lockP50 = p50Us(latenciesNs);
  fmt::print(
      "lock {} (flags {:#x}){}: {} holds, p50 {:.1f} µs, p90 {:.1f} µs; echo p50 {:.1f} µs; "
      "lock / echo p50 {:.2f}x\n",
      plugIn, flags, terminate.empty() ? "" : ", ending a running instance first", count, lockP50,
      p90Us(latenciesNs), echoP50, echoP50 > 0 ? lockP50 / echoP50 : 0);
  return kSuccess;
}
