#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/value/Result.h"

// Closed-loop load over Wyre frames: each connection sends one request, waits for its reply,
// and only then sends the next, so every figure is an honest round trip.
namespace ek::bench {

using Seconds = std::chrono::duration<double>;

struct LoadOptions {
  std::string socketPath;
  unsigned connections = 1;
  // Traffic before the measurement starts; not counted.
  Seconds warmup{0.0};
  // Bound of the measured phase. The run always ends by then, with or without a count.
  Seconds duration{5.0};
  // Total measured requests over all connections; the run ends when they are sent.
  std::optional<uint64_t> count;
  // A reply later than this is a transport failure; the connection is then opened again.
  std::chrono::milliseconds replyTimeout{5000};
  // Builds every reply whole in the value model, as the client library does. Otherwise a reply
  // is checked as strictly but only its error members are built: the figures then measure the
  // daemon rather than this client's decoding of large replies.
  bool decodeReplies = false;
  // How a connection waits for its reply (FrameReader::Wait): for readiness by default, as the
  // client library's event loop does; asleep in recv with this set.
  bool waitInRecv = false;
  // A process whose CPU time (utime + stime, /proc/<pid>/stat) over the measured phase the
  // result reports: the daemon's cost per request, which moves far less than latency does on a
  // shared machine.
  std::optional<int> cpuOfPid;
};

// Latency figures in microseconds.
struct LatencySummary {
  double p50 = 0;
  double p90 = 0;
  double p99 = 0;
  double max = 0;
  double mean = 0;
};

struct LoadResult {
  // Round trips completed in the measured phase, error replies included.
  uint64_t requests = 0;
  // Replies whose body is a map with a non-zero "errorcode".
  uint64_t errorReplies = 0;
  // Send or receive failures, timeouts, closed connections, replies with the wrong id or
  // without the reply flag, and bodies that do not decode as CBOR.
  uint64_t failures = 0;
  // Wall time of the measured phase, up to the last reply.
  double seconds = 0;
  // CPU seconds options.cpuOfPid used over the measured phase, when asked and readable.
  std::optional<double> cpuSeconds;
  // What went wrong first, for the report: the "error" text of the first error reply (or its
  // code when it has none), and the first failure's cause.
  std::string firstError;
  std::string firstFailure;
  // One entry per completed round trip, in nanoseconds, in no particular order.
  std::vector<uint64_t> latenciesNs;

  double requestsPerSecond() const { return seconds > 0 ? requests / seconds : 0; }
  // Microseconds of the measured process's CPU per request, when measured.
  std::optional<double> cpuMicrosPerRequest() const;
  LatencySummary latency() const;
};

// Runs the load against the Unix socket at options.socketPath with body, the CBOR encoding of
// one request, sent in frames that want a reply and carry increasing ids. Fails only when a
// connection cannot be opened at the start; everything after that is counted in the result.
Result<LoadResult> runLoad(const LoadOptions& options, std::span<const uint8_t> body);

// The same with several requests: each connection sends them in turn, wrapping around,
// connection i of n starting at request i * bodies.size() / n, so that the connections do not
// all ask for the same thing at once.
Result<LoadResult> runLoad(const LoadOptions& options,
                           std::span<const std::vector<uint8_t>> bodies);

// The request connection `connection` of `connections` sends first among `requests`.
size_t firstRequestOf(unsigned connection, unsigned connections, size_t requests);

// CPU seconds (utime + stime) process pid has used; nullopt when it cannot be read.
std::optional<double> processCpuSeconds(int pid);

// Sums several runs: their requests, errors, failures, times and latencies.
LoadResult combine(const std::vector<LoadResult>& runs);

// The nearest-rank percentile (fraction in [0, 1]) of ascending values; 0 when empty.
uint64_t percentile(const std::vector<uint64_t>& sorted, double fraction);

}  // namespace ek::bench
