// dbus_peer: the same lookup through D-Bus, for comparison with the daemon. A service on a
// (private) bus answers the method Find, whose argument is a 16-byte UUID, with a byte array of
// the size of a find reply; the client calls it from one or more connections, each on its own
// thread, closed-loop as ekbench does.
//
//   dbus_peer serve --address ADDR [--reply-bytes N]
//   dbus_peer call --address ADDR [--connections N] [--duration S] [--warmup S] [--rounds R]

#include <systemd/sd-bus.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include <fmt/format.h>

#include "bench/LoadGenerator.h"

namespace {

constexpr const char* kName = "com.corvane.bench.Peer";
constexpr const char* kPath = "/com/corvane/bench/Peer";
constexpr const char* kInterface = "com.corvane.bench.Peer";
constexpr size_t kMaxReplyBytes = 1 << 20;

using Clock = std::chrono::steady_clock;

// One bus connection, unreferenced on every way out.
struct Bus {
  sd_bus* bus = nullptr;
  ~Bus() { sd_bus_flush_close_unref(bus); }
};

int open(Bus& bus, const std::string& address) {
  int r = sd_bus_new(&bus.bus);
  if (r >= 0) r = sd_bus_set_address(bus.bus, address.c_str());
  if (r >= 0) r = sd_bus_set_bus_client(bus.bus, 1);
  if (r >= 0) r = sd_bus_start(bus.bus);
  return r;
}

std::vector<uint8_t> gReply;

int find(sd_bus_message* call, void*, sd_bus_error*) {
  const void* uuid = nullptr;
  size_t size = 0;
  int r = sd_bus_message_read_array(call, 'y', &uuid, &size);
  if (r < 0) return r;
  if (size != 16) return -EINVAL;
  sd_bus_message* reply = nullptr;
  r = sd_bus_message_new_method_return(call, &reply);
  if (r >= 0) r = sd_bus_message_append_array(reply, 'y', gReply.data(), gReply.size());
  if (r >= 0) r = sd_bus_send(nullptr, reply, nullptr);
  sd_bus_message_unref(reply);
  return r < 0 ? r : 1;
}

const sd_bus_vtable kVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("Find", "ay", "ay", find, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

int serve(const std::string& address, size_t replyBytes) {
  gReply.assign(replyBytes, 0xa5);
  Bus bus;
  int r = open(bus, address);
  if (r >= 0) r = sd_bus_add_object_vtable(bus.bus, nullptr, kPath, kInterface, kVtable, nullptr);
  if (r >= 0) r = sd_bus_request_name(bus.bus, kName, 0);
  if (r < 0) {
    std::fprintf(stderr, "dbus_peer: serving on %s: %s\n", address.c_str(), std::strerror(-r));
    return 3;
  }
  // Until the bus goes away (bench/run ends the daemon, or the service).
  for (;;) {
    r = sd_bus_process(bus.bus, nullptr);
    if (r < 0) return r == -ECONNRESET || r == -ENOTCONN ? 0 : 1;
    if (r > 0) continue;
    r = sd_bus_wait(bus.bus, UINT64_MAX);
    if (r < 0 && r != -EINTR) return 1;
  }
}

struct Caller {
  Bus bus;
  ek::bench::LoadResult result;
  Clock::time_point finished;
};

void callLoop(Caller& caller, Clock::time_point warmEnd, Clock::time_point end) {
  static const uint8_t kUuid[16] = {0xd1, 0xf5, 0x20, 0x58, 0xc7, 0x8a, 0x49, 0x22,
                                    0xa9, 0x25, 0xf2, 0x6b, 0xf5, 0xe0, 0x86, 0xa3};
  caller.result.latenciesNs.reserve(1u << 16);
  for (;;) {
    Clock::time_point sent = Clock::now();
    if (sent >= end) break;
    sd_bus_message* call = nullptr;
    sd_bus_message* reply = nullptr;
    sd_bus_error error = SD_BUS_ERROR_NULL;
    int r = sd_bus_message_new_method_call(caller.bus.bus, &call, kName, kPath, kInterface, "Find");
    if (r >= 0) r = sd_bus_message_append_array(call, 'y', kUuid, sizeof kUuid);
    if (r >= 0) r = sd_bus_call(caller.bus.bus, call, 5'000'000, &error, &reply);
    const void* bytes = nullptr;
    size_t size = 0;
    if (r >= 0) r = sd_bus_message_read_array(reply, 'y', &bytes, &size);
    Clock::time_point received = Clock::now();
    sd_bus_message_unref(call);
    sd_bus_message_unref(reply);
    sd_bus_error_free(&error);
    if (r < 0 || size == 0) {
      ++caller.result.failures;
      if (caller.result.firstFailure.empty()) caller.result.firstFailure = std::strerror(-r);
      break;
    }
    if (sent < warmEnd) continue;
    ++caller.result.requests;
    caller.result.latenciesNs.push_back(static_cast<uint64_t>(
        std::chrono::duration_cast<std::chrono::nanoseconds>(received - sent).count()));
  }
  caller.finished = Clock::now();
}

ek::bench::LoadResult callRound(const std::string& address, unsigned connections, double warmup,
                                double duration) {
  std::vector<Caller> callers(connections);
  ek::bench::LoadResult total;
  for (Caller& caller : callers) {
    if (int r = open(caller.bus, address); r < 0) {
      total.failures = 1;
      total.firstFailure = fmt::format("connecting to {}: {}", address, std::strerror(-r));
      return total;
    }
  }
  Clock::time_point start = Clock::now();
  Clock::time_point warmEnd =
      start + std::chrono::duration_cast<Clock::duration>(ek::bench::Seconds(warmup));
  Clock::time_point end =
      warmEnd + std::chrono::duration_cast<Clock::duration>(ek::bench::Seconds(duration));
  std::vector<std::thread> threads;
  for (Caller& caller : callers) threads.emplace_back([&] { callLoop(caller, warmEnd, end); });
  for (std::thread& thread : threads) thread.join();
  Clock::time_point last = warmEnd;
  std::vector<ek::bench::LoadResult> parts;
  for (Caller& caller : callers) {
    last = std::max(last, caller.finished);
    parts.push_back(std::move(caller.result));
  }
  total = ek::bench::combine(parts);
  total.seconds = ek::bench::Seconds(last - warmEnd).count();
  return total;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"dbus_peer: a D-Bus method call answered with a reply of a find's size"};
  app.require_subcommand(1);
  std::string address;
  size_t replyBytes = 1800;
  unsigned connections = 1;
  unsigned rounds = 1;
  double duration = 3;
  double warmup = 0.5;
  auto* serveCommand = app.add_subcommand("serve", "answer Find on the bus");
  serveCommand->add_option("--address", address, "the bus address")->required();
  serveCommand->add_option("--reply-bytes", replyBytes, "bytes in each reply (default 1800)")
      ->check(CLI::Range(size_t{1}, kMaxReplyBytes));
  auto* callCommand = app.add_subcommand("call", "call Find closed-loop and print the figures");
  callCommand->add_option("--address", address, "the bus address")->required();
  callCommand->add_option("--connections", connections, "bus connections, one thread each")
      ->check(CLI::Range(1u, 1024u));
  callCommand->add_option("--duration", duration, "seconds measured per round (default 3)")
      ->check(CLI::Range(0.001, 3600.0));
  callCommand->add_option("--warmup", warmup, "seconds before measuring (default 0.5)")
      ->check(CLI::Range(0.0, 600.0));
  callCommand->add_option("--rounds", rounds, "rounds (default 1)")->check(CLI::Range(1u, 20u));
  CLI11_PARSE(app, argc, argv);

  if (serveCommand->parsed()) return serve(address, replyBytes);

  std::vector<ek::bench::LoadResult> all;
  fmt::print("dbus_peer: {} connection{}, {:.1f} s per round; latencies in µs\n", connections,
             connections == 1 ? "" : "s", duration);
  fmt::print("{:<12} {:>10} {:>8} {:>10} {:>9} {:>9} {:>9} {:>9} {:>8}\n", "run", "calls",
             "seconds", "calls/s", "p50", "p90", "p99", "max", "failures");
  auto row = [](const std::string& name, const ek::bench::LoadResult& run) {
    ek::bench::LatencySummary l = run.latency();
    fmt::print("{:<12} {:>10} {:>8.2f} {:>10.0f} {:>9.1f} {:>9.1f} {:>9.1f} {:>9.1f} {:>8}\n", name,
               run.requests, run.seconds, run.requestsPerSecond(), l.p50, l.p90, l.p99, l.max,
               run.failures);
  };
  for (unsigned round = 0; round < rounds; ++round) {
    all.push_back(callRound(address, connections, warmup, duration));
    row(fmt::format("dbus #{}", round + 1), all.back());
  }
  ek::bench::LoadResult sum = ek::bench::combine(all);
  if (rounds > 1) row("dbus all", sum);
  if (!sum.firstFailure.empty()) fmt::print("dbus: first failure: {}\n", sum.firstFailure);
  return sum.failures == 0 && sum.requests > 0 ? 0 : 1;
}
