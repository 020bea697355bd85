// startup_bench: time from starting a service to its first answered request.
//
//   startup_bench --socket PATH [--starts N] [--timeout SECONDS] [--keep-last PIDFILE] [--json]
//                 -- PROGRAM ARGS...
//
// Each start forks and executes PROGRAM, then connects to PATH and sends a trivial request in
// a tight loop (a pause of 100 µs between attempts, so as not to starve the service on a small
// machine) until a reply arrives; the time from just before the fork to that reply is the
// figure. The service is then ended with SIGTERM and reaped before the next start, except the
// last one with --keep-last, which is left running with its process id written to PIDFILE. The
// request is {"request":"bulk","version":3} unless --request gives another.

#include <fmt/format.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "bench/FrameIo.h"
#include "bench/LoadGenerator.h"
#include "platform/cbor/Cbor.h"
#include "platform/json/WireJson.h"
#include "platform/wyre/Wyre.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kSuccess = 0;
constexpr int kFailed = 1;
constexpr int kUsage = 2;

// One attempt: connect, send, wait for the reply. True once a reply frame arrived.
bool answered(const std::string& socket, const std::vector<uint8_t>& frame,
              Clock::time_point deadline) {
  int fd = ek::bench::connectUnix(socket);
  if (fd < 0) return false;
  bool replied = false;
  auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
  if (left.count() > 0 && ek::bench::setIoTimeout(fd, left) &&
      ek::bench::writeAll(fd, frame.data(), frame.size())) {
    ek::bench::FrameReader reader;
    ek::wyre::FrameHeader header;
    std::span<const uint8_t> body;
    replied = reader.next(fd, header, body, deadline) == ek::bench::FrameReader::Status::Frame &&
              (header.flags & ek::wyre::kFlagReply) && header.id == 1;
  }
  ::close(fd);
  return replied;
}

// Starts the program, answers the seconds to its first reply, or nothing when it exited or
// did not answer in time. The program is ended and reaped unless keep is set and it answered;
// then pid holds its process id.
std::optional<double> timeOneStart(const std::vector<std::string>& command,
                                   const std::string& socket, const std::vector<uint8_t>& frame,
                                   double timeout, bool keep, pid_t& started) {
  std::vector<char*> argv;
  for (const std::string& word : command) argv.push_back(const_cast<char*>(word.c_str()));
  argv.push_back(nullptr);

  Clock::time_point start = Clock::now();
  pid_t pid = ::fork();
  if (pid < 0) {
    std::fprintf(stderr, "startup_bench: fork: %s\n", std::strerror(errno));
    return std::nullopt;
  }
  if (pid == 0) {
    ::execv(argv[0], argv.data());
    std::fprintf(stderr, "startup_bench: %s: %s\n", argv[0], std::strerror(errno));
    ::_exit(127);
  }
  Clock::time_point deadline =
      start + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(timeout));
  std::optional<double> seconds;
  for (;;) {
    if (answered(socket, frame, deadline)) {
      seconds = std::chrono::duration<double>(Clock::now() - start).count();
      break;
    }
    int status = 0;
    if (::waitpid(pid, &status, WNOHANG) == pid) {
      std::fprintf(stderr, "startup_bench: %s ended before answering (status %d)\n", argv[0],
                   status);
      return std::nullopt;
    }
    if (Clock::now() >= deadline) {
      std::fprintf(stderr, "startup_bench: no answer within %.1f s\n", timeout);
      break;
    }
    std::this_thread::sleep_for(std::chrono::microseconds(100));
  }
  started = pid;
  if (keep && seconds) return seconds;
  ::kill(pid, SIGTERM);
  int status = 0;
  while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  return seconds;
}

}  // namespace

int main(int argc, char** argv) {
  std::string socket;
  unsigned starts = 5;
  double timeout = 600;
  bool json = false;
  std::string keepLast;
  std::string requestText = R"({"request":"bulk","version":3})";
  std::vector<std::string> command;
  CLI::App app{"startup_bench: time from starting a service to its first answered request"};
  app.add_option("--socket", socket, "the service's Unix socket")->required();
  app.add_option("--starts", starts, "starts to time (default 5)")->check(CLI::Range(1u, 1000u));
  app.add_option("--timeout", timeout, "seconds one start may take (default 600)")
      ->check(CLI::Range(0.001, 3600.0));
  app.add_option("--request", requestText, "the request in wire JSON");
  app.add_option("--keep-last", keepLast,
                 "leave the last start running and write its process id to this file");
  app.add_flag("--json", json, "print one JSON object");
  app.add_option("command", command, "the program (an absolute or relative path) and its arguments")
      ->required();
  app.positionals_at_end();
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    int code = app.exit(e);
    return code == 0 ? kSuccess : kUsage;
  }
  ek::Result<ek::Value> request = ek::wirejson::parse(requestText);
  if (!request) {
    std::fprintf(stderr, "startup_bench: invalid request: %s\n", request.error().message.c_str());
    return kUsage;
  }
  std::vector<uint8_t> body = ek::cbor::encode(*request);
  if (body.size() > ek::wyre::kMaxBodySize) {
    std::fprintf(stderr, "startup_bench: the request is larger than a frame may carry\n");
    return kUsage;
  }
  std::vector<uint8_t> frame(ek::wyre::kHeaderSize);
  ek::wyre::encodeHeader({static_cast<uint32_t>(body.size()), ek::wyre::kFlagWantsReply, 1},
                         frame.data());
  frame.insert(frame.end(), body.begin(), body.end());

  std::vector<uint64_t> nanoseconds;
  for (unsigned i = 0; i < starts; ++i) {
    bool keep = !keepLast.empty() && i + 1 == starts;
    pid_t pid = -1;
    std::optional<double> seconds = timeOneStart(command, socket, frame, timeout, keep, pid);
    if (!seconds) return kFailed;
    if (keep) {
      FILE* file = std::fopen(keepLast.c_str(), "w");
      bool written = file != nullptr && std::fprintf(file, "%d\n", static_cast<int>(pid)) > 0;
      if (file != nullptr && std::fclose(file) != 0) written = false;
      if (!written) {
        std::fprintf(stderr, "startup_bench: %s: %s; ending %d\n", keepLast.c_str(),
                     std::strerror(errno), static_cast<int>(pid));
        ::kill(pid, SIGTERM);
        return kFailed;
      }
    }
    nanoseconds.push_back(static_cast<uint64_t>(*seconds * 1e9));
  }
  std::vector<uint64_t> sorted = nanoseconds;
  std::sort(sorted.begin(), sorted.end());
  auto millis = [](uint64_t ns) { return static_cast<double>(ns) / 1e6; };
  std::string each;
  for (uint64_t ns : nanoseconds)
    each += fmt::format("{}{:.1f}", each.empty() ? "" : ", ", millis(ns));
  if (json) {
    fmt::print(R"({{"starts_ms":[{}],"median_ms":{:.1f},"max_ms":{:.1f}}})"
               "\n",
               each, millis(ek::bench::percentile(sorted, 0.5)), millis(sorted.back()));
  } else {
    fmt::print("first answer after start: median {:.1f} ms, max {:.1f} ms (starts: {} ms)\n",
               millis(ek::bench::percentile(sorted, 0.5)), millis(sorted.back()), each);
  }
  return kSuccess;
}
