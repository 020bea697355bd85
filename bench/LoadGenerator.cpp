#include "bench/LoadGenerator.h"

#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <latch>
#include <system_error>
#include <thread>

#include "Ekora/EkProtocol.h"
#include "bench/FrameIo.h"
#include "platform/cbor/Cbor.h"
#include "platform/wyre/Wyre.h"

namespace ek::bench {

namespace {

using Clock = std::chrono::steady_clock;

enum class Outcome { Reply, ErrorReply, Failure };

// The error of a reply whose "errorcode", its low 32 bits read as a signed code, is not zero.
std::optional<std::string> replyError(const Dictionary& reply) {
  auto code = reply.find(protocol::kErrorCode);
  if (code == reply.end()) return std::nullopt;
  int32_t signedCode = 0;
  if (const uint64_t* number = code->second.unsignedNumber()) {
    signedCode = static_cast<int32_t>(static_cast<uint32_t>(*number));
  } else if (const int64_t* negative = code->second.negativeNumber()) {
    signedCode = static_cast<int32_t>(*negative);
  }
  if (signedCode == 0) return std::nullopt;
  auto text = reply.find(protocol::kError);
  const std::string* message = text == reply.end() ? nullptr : text->second.string();
  return message ? fmt::format("error {}: {}", signedCode, *message)
                 : fmt::format("error {}", signedCode);
}

// The members replyError reads, of a reply decoded as options ask.
Result<Dictionary> replyMembers(std::span<const uint8_t> body, bool whole) {
  static constexpr std::string_view kErrorKeys[] = {protocol::kErrorCode, protocol::kError};
  if (!whole) return cbor::decodeEntries(body, kErrorKeys);
  Result<Value> reply = cbor::decode(body);
  if (!reply) return reply.error();
  Dictionary* members = reply->getIf<Dictionary>();
  return members ? std::move(*members) : Dictionary{};
}

const char* describe(FrameReader::Status status) {
  switch (status) {
    case FrameReader::Status::Frame:
      return "frame";
    case FrameReader::Status::Closed:
      return "connection closed by the peer";
    case FrameReader::Status::Failed:
      return "receive failed";
    case FrameReader::Status::TooLarge:
      return "reply header announces an oversized body";
    case FrameReader::Status::TimedOut:
      return "no reply in time";
  }
  return "unknown";
}

struct Worker {
  int fd = -1;
  FrameReader reader;
  // The requests, sent in turn from next on; frame is header + the body being sent. With one
  // request the frame is built once and only the id changes between sends.
  std::span<const std::vector<uint8_t>> bodies;
  size_t next = 0;
  std::vector<uint8_t> frame;
  uint64_t nextId = 1;
  LoadResult result;
  Clock::time_point finished;

  void disconnect() {
    if (fd >= 0) ::close(fd);
    fd = -1;
    reader.reset();
  }

  bool connect(const LoadOptions& options) {
    fd = connectUnix(options.socketPath);
    if (fd < 0) return false;
    if (!setIoTimeout(fd, options.replyTimeout)) {
      disconnect();
      return false;
    }
    return true;
  }

  void fail(std::string_view why) {
    ++result.failures;
    if (result.firstFailure.empty()) result.firstFailure = std::string(why);
  }

  Outcome roundTrip(Clock::time_point& sent, Clock::time_point& received,
                    std::chrono::milliseconds timeout, bool decodeReplies) {
    uint64_t id = nextId++;
    if (bodies.size() > 1) {
      const std::vector<uint8_t>& body = bodies[next];
      next = next + 1 == bodies.size() ? 0 : next + 1;
      frame.resize(wyre::kHeaderSize);
      frame.insert(frame.end(), body.begin(), body.end());
    }
    wyre::encodeHeader(
        {static_cast<uint32_t>(frame.size() - wyre::kHeaderSize), wyre::kFlagWantsReply, id},
        frame.data());
    sent = Clock::now();
    if (!writeAll(fd, frame.data(), frame.size())) {
      fail("send failed");
      return Outcome::Failure;
    }
    wyre::FrameHeader header;
    std::span<const uint8_t> body;
    FrameReader::Status status = reader.next(fd, header, body, sent + timeout);
    received = Clock::now();
    if (status != FrameReader::Status::Frame) {
      fail(describe(status));
      return Outcome::Failure;
    }
    if (!(header.flags & wyre::kFlagReply)) {
      fail("answer without the reply flag");
      return Outcome::Failure;
    }
    if (header.id != id) {
      fail(fmt::format("reply carries id {}, expected {}", header.id, id));
      return Outcome::Failure;
    }
    Result<Dictionary> reply = replyMembers(body, decodeReplies);
    if (!reply) {
      fail("undecodable reply: " + reply.error().message);
      return Outcome::Failure;
    }
    std::optional<std::string> error = replyError(*reply);
    if (!error) return Outcome::Reply;
    if (result.firstError.empty()) result.firstError = std::move(*error);
    return Outcome::ErrorReply;
  }

  void run(const LoadOptions& options, Clock::time_point warmEnd, Clock::time_point end,
           std::atomic<uint64_t>& tickets) {
    result.latenciesNs.reserve(1u << 16);
    for (;;) {
      Clock::time_point now = Clock::now();
      if (now >= end) break;
      bool measured = now >= warmEnd;
      if (measured && options.count && tickets.fetch_add(1) >= *options.count) break;
      if (fd < 0 && !connect(options)) {
        fail("reconnecting failed: " + std::error_code(errno, std::generic_category()).message());
        break;
      }
      Clock::time_point sent, received;
      Outcome outcome = roundTrip(sent, received, options.replyTimeout, options.decodeReplies);
      // Failures count in the warm-up too: they say the figures cannot be trusted.
      if (outcome == Outcome::Failure) {
        disconnect();
        continue;
      }
      if (!measured) continue;
      ++result.requests;
      if (outcome == Outcome::ErrorReply) ++result.errorReplies;
      result.latenciesNs.push_back(static_cast<uint64_t>(
          std::chrono::duration_cast<std::chrono::nanoseconds>(received - sent).count()));
    }
    finished = Clock::now();
  }
};

}  // namespace

std::optional<double> processCpuSeconds(int pid) {
  FILE* file = std::fopen(fmt::format("/proc/{}/stat", pid).c_str(), "re");
  if (!file) return std::nullopt;
  char line[1024];
  bool read = std::fgets(line, sizeof line, file) != nullptr;
  std::fclose(file);
  if (!read) return std::nullopt;
  // The command name may hold spaces and parentheses: the fields start after the last ')'.
  const char* fields = std::strrchr(line, ')');
  if (!fields) return std::nullopt;
  unsigned long long utime = 0, stime = 0;
  // Fields 3.. after the name; utime and stime are fields 14 and 15.
  if (std::sscanf(fields + 1, " %*c %*d %*d %*d %*d %*d %*u %*u %*u %*u %*u %llu %llu", &utime,
                  &stime) != 2) {
    return std::nullopt;
  }
  return static_cast<double>(utime + stime) / static_cast<double>(::sysconf(_SC_CLK_TCK));
}

std::optional<double> LoadResult::cpuMicrosPerRequest() const {
  if (!cpuSeconds || requests == 0) return std::nullopt;
  return *cpuSeconds * 1e6 / static_cast<double>(requests);
}

uint64_t percentile(const std::vector<uint64_t>& sorted, double fraction) {
  if (sorted.empty()) return 0;
  double rank = std::ceil(std::clamp(fraction, 0.0, 1.0) * static_cast<double>(sorted.size()));
  size_t index = rank < 1 ? 0 : static_cast<size_t>(rank) - 1;
  return sorted[std::min(index, sorted.size() - 1)];
}

LatencySummary LoadResult::latency() const {
  LatencySummary summary;
  if (latenciesNs.empty()) return summary;
  std::vector<uint64_t> sorted = latenciesNs;
  std::sort(sorted.begin(), sorted.end());
  auto micros = [](uint64_t ns) { return static_cast<double>(ns) / 1000.0; };
  summary.p50 = micros(percentile(sorted, 0.50));
  summary.p90 = micros(percentile(sorted, 0.90));
  summary.p99 = micros(percentile(sorted, 0.99));
  summary.max = micros(sorted.back());
  long double total = 0;
  for (uint64_t ns : sorted) total += ns;
  summary.mean = micros(static_cast<uint64_t>(total / sorted.size()));
  return summary;
}

LoadResult combine(const std::vector<LoadResult>& runs) {
  LoadResult sum;
  for (const LoadResult& run : runs) {
    sum.requests += run.requests;
    sum.errorReplies += run.errorReplies;
    sum.failures += run.failures;
    sum.seconds += run.seconds;
    if (run.cpuSeconds) sum.cpuSeconds = sum.cpuSeconds.value_or(0) + *run.cpuSeconds;
    if (sum.firstError.empty()) sum.firstError = run.firstError;
    if (sum.firstFailure.empty()) sum.firstFailure = run.firstFailure;
    sum.latenciesNs.insert(sum.latenciesNs.end(), run.latenciesNs.begin(), run.latenciesNs.end());
  }
  return sum;
}

size_t firstRequestOf(unsigned connection, unsigned connections, size_t requests) {
  if (connections == 0 || requests == 0) return 0;
  // Both factors are bounded (connections and request lines), far from overflowing 64 bits.
  return static_cast<size_t>(uint64_t{connection % connections} * requests / connections);
}

Result<LoadResult> runLoad(const LoadOptions& options, std::span<const uint8_t> body) {
  std::vector<std::vector<uint8_t>> bodies{std::vector<uint8_t>(body.begin(), body.end())};
  return runLoad(options, std::span<const std::vector<uint8_t>>(bodies));
}

Result<LoadResult> runLoad(const LoadOptions& options,
                           std::span<const std::vector<uint8_t>> bodies) {
  if (options.connections == 0) return EkError::posix(EINVAL, "at least one connection is needed");
  if (bodies.empty()) return EkError::posix(EINVAL, "at least one request is needed");
  for (const std::vector<uint8_t>& body : bodies) {
    if (body.size() > wyre::kMaxBodySize) {
      return EkError::posix(EMSGSIZE, "request body larger than a frame may carry");
    }
  }
  std::vector<Worker> workers(options.connections);
  for (size_t i = 0; i < workers.size(); ++i) {
    Worker& worker = workers[i];
    worker.bodies = bodies;
    worker.reader = FrameReader(options.waitInRecv ? FrameReader::Wait::InRecv
                                                   : FrameReader::Wait::ForReadiness);
    worker.next = firstRequestOf(static_cast<unsigned>(i), options.connections, bodies.size());
    worker.frame.resize(wyre::kHeaderSize);
    if (bodies.size() == 1) {
      worker.frame.insert(worker.frame.end(), bodies[0].begin(), bodies[0].end());
    }
    if (!worker.connect(options)) {
      EkError error = EkError::fromErrno(errno, "connecting to " + options.socketPath);
      for (Worker& opened : workers) opened.disconnect();
      return error;
    }
  }

  // Every thread starts from the same instant, taken once all of them are running.
  std::latch ready(static_cast<std::ptrdiff_t>(workers.size()));
  std::atomic<bool> go{false};
  Clock::time_point start;
  std::atomic<uint64_t> tickets{0};
  auto warmup = std::chrono::duration_cast<Clock::duration>(options.warmup);
  auto duration = std::chrono::duration_cast<Clock::duration>(options.duration);

  std::vector<std::thread> threads;
  threads.reserve(workers.size());
  for (Worker& worker : workers) {
    threads.emplace_back([&] {
      ready.count_down();
      go.wait(false, std::memory_order_acquire);
      worker.run(options, start + warmup, start + warmup + duration, tickets);
    });
  }
  ready.wait();
  start = Clock::now();
  go.store(true, std::memory_order_release);
  go.notify_all();
  std::optional<double> cpuBefore;
  if (options.cpuOfPid) {
    std::this_thread::sleep_until(start + warmup);
    cpuBefore = processCpuSeconds(*options.cpuOfPid);
  }
  LoadResult total;
  for (std::thread& thread : threads) thread.join();
  if (cpuBefore) {
    std::optional<double> cpuAfter = processCpuSeconds(*options.cpuOfPid);
    if (cpuAfter) total.cpuSeconds = *cpuAfter - *cpuBefore;
  }

  Clock::time_point measureStart = start + warmup;
  Clock::time_point last = measureStart;
  for (Worker& worker : workers) {
    worker.disconnect();
    last = std::max(last, worker.finished);
    total.requests += worker.result.requests;
    total.errorReplies += worker.result.errorReplies;
    total.failures += worker.result.failures;
    if (total.firstError.empty()) total.firstError = worker.result.firstError;
    if (total.firstFailure.empty()) total.firstFailure = worker.result.firstFailure;
    total.latenciesNs.insert(total.latenciesNs.end(), worker.result.latenciesNs.begin(),
                             worker.result.latenciesNs.end());
  }
  total.seconds = Seconds(last - measureStart).count();
  return total;
}

}  // namespace ek::bench
