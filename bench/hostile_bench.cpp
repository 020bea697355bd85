// hostile_bench: what a crowd of idle connections and a flood of messages that want no reply
// cost another client. Starts its own daemon, measures one client's "find" alone, then again
// while 600 connections sit idle and one connection sends 10,000 frames wanting no reply,
// and reports the daemon's resident memory and CPU time per request.
#include <fcntl.h>
#include <fmt/format.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "bench/FrameIo.h"
#include "platform/cbor/Cbor.h"
#include "platform/wyre/Wyre.h"

namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;
using ek::Dictionary;
using ek::Value;

struct Options {
  std::string ekd = EKD_PATH;
  std::string examples = EXAMPLES_DIR;
  unsigned idle = 600;
  unsigned flood = 10000;
  unsigned samples = 20000;
};

long residentKiB(pid_t pid) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("VmRSS:", 0) == 0) return std::stol(line.substr(6));
  }
  return -1;
}

// User and system CPU time of a process, in microseconds.
double cpuMicros(pid_t pid) {
  std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
  std::string text((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
  std::istringstream fields(text.substr(text.rfind(')') + 2));
  std::string field;
  double ticks = 0;
  for (int i = 3; i <= 15 && fields >> field; ++i) {
    if (i == 14 || i == 15) ticks += std::stod(field);
  }
  return ticks * 1e6 / static_cast<double>(sysconf(_SC_CLK_TCK));
}

std::vector<uint8_t> frame(const Value& body, uint32_t flags) {
  std::vector<uint8_t> bytes;
  ek::wyre::appendFrame(bytes, body, flags, 1);
  return bytes;
}

struct Latencies {
  std::vector<double> micros;
  double percentile(double p) {
    if (micros.empty()) return 0;
    std::sort(micros.begin(), micros.end());
    return micros[std::min(micros.size() - 1, static_cast<size_t>(p * micros.size()))];
  }
};

// One find after the other on fd, until count are done or keepGoing says stop.
template <typename KeepGoing>
Latencies measure(int fd, const std::vector<uint8_t>& request, unsigned count,
                  KeepGoing keepGoing) {
  ek::bench::FrameReader reader(ek::bench::FrameReader::Wait::ForReadiness);
  Latencies latencies;
  while (latencies.micros.size() < count && keepGoing()) {
    auto start = Clock::now();
    ek::wyre::FrameHeader header;
    std::span<const uint8_t> body;
    if (!ek::bench::writeAll(fd, request.data(), request.size()) ||
        reader.next(fd, header, body) != ek::bench::FrameReader::Status::Frame) {
      std::fprintf(stderr, "hostile_bench: the daemon stopped answering\n");
      std::exit(1);
    }
    latencies.micros.push_back(
        std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  return latencies;
}

}  // namespace

int main(int argc, char** argv) {
  Options options;
  CLI::App app{"Another client's find under idle connections and a no-reply flood"};
  app.add_option("--ekd", options.ekd, "the daemon to start");
  app.add_option("--examples", options.examples, "the examples directory (its System volume)");
  app.add_option("--idle", options.idle, "idle connections");
  app.add_option("--flood", options.flood, "frames wanting no reply");
  app.add_option("--samples", options.samples, "finds measured alone");
  CLI11_PARSE(app, argc, argv);

  char pattern[] = "/tmp/hostile-bench-XXXXXX";
  fs::path root = mkdtemp(pattern);
  fs::copy(fs::path(options.examples) / "System", root / "System", fs::copy_options::recursive);
  setenv("EKORA_RUNTIME_DIR", (root / "run").c_str(), 1);
  setenv("EKORA_STATE_DIR", (root / "state").c_str(), 1);
  setenv("EKORA_SYSTEM_ROOT", (root / "System").c_str(), 1);
  setenv("EKORA_LOG", "default", 1);
  std::string socket = (root / "run" / "bench.hostile").string();
  pid_t ekd = fork();
  if (ekd == 0) {
    int log = open((root / "ekd.log").c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
    dup2(log, 2);
    execl(options.ekd.c_str(), options.ekd.c_str(), "-S", "bench.hostile",
          static_cast<char*>(nullptr));
    _exit(127);
  }
  int client = -1;
  for (int i = 0; i < 2000 && client < 0; ++i) {
    client = ek::bench::connectUnix(socket);
    if (client < 0) std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  if (client < 0) {
    std::fprintf(stderr, "hostile_bench: the daemon did not start (see %s)\n",
                 (root / "ekd.log").c_str());
    return 3;
  }

  std::string url = "file://" + (root / "System/Library/PlugIns/SpellCheck.bundle").string();
  Value find(Dictionary{{"request", "find"}, {"version", 3u}, {"paths", Value(url)}});
  auto wanted = frame(find, ek::wyre::kFlagWantsReply);
  auto unwanted = frame(find, 0);

  measure(client, wanted, 200, [] { return true; });  // warm-up
  double cpuBefore = cpuMicros(ekd);
  Latencies alone = measure(client, wanted, options.samples, [] { return true; });
  double cpuPerFind = (cpuMicros(ekd) - cpuBefore) / options.samples;
  long residentAlone = residentKiB(ekd);

  std::vector<int> idle;
  for (unsigned i = 0; i < options.idle; ++i) idle.push_back(ek::bench::connectUnix(socket));
  // Every idle connection accepted and its client record made.
  std::this_thread::sleep_for(std::chrono::seconds(1));
  measure(client, wanted, 100, [] { return true; });
  long residentIdle = residentKiB(ekd);

  int flooder = ek::bench::connectUnix(socket);
  std::atomic<bool> flooding{true};
  cpuBefore = cpuMicros(ekd);
  auto floodStart = Clock::now();
  std::thread flood([&] {
    std::vector<uint8_t> batch;
    for (int i = 0; i < 100; ++i) batch.insert(batch.end(), unwanted.begin(), unwanted.end());
    for (unsigned sent = 0; sent < options.flood; sent += 100) {
      ek::bench::writeAll(flooder, batch.data(), batch.size());
    }
    flooding = false;
  });
  long residentPeak = residentIdle;
  unsigned served = 0;
  Latencies flooded = measure(client, wanted, 1u << 30, [&] {
    if (++served % 50 == 0) residentPeak = std::max(residentPeak, residentKiB(ekd));
    return flooding.load() || served < 200;
  });
  flood.join();
  // The flood's last frames are read once the writes above return; one more find waits for
  // them, then the CPU the daemon spent is divided over every request it served meanwhile.
  measure(client, wanted, 1, [] { return true; });
  double floodSeconds = std::chrono::duration<double>(Clock::now() - floodStart).count();
  double cpuPerRequest =
      (cpuMicros(ekd) - cpuBefore) / static_cast<double>(options.flood + flooded.micros.size());
  residentPeak = std::max(residentPeak, residentKiB(ekd));

  double p50Alone = alone.percentile(0.5);
  double p50Flooded = flooded.percentile(0.5);
  fmt::print("find alone:               p50 {:.1f} us, p99 {:.1f} us, daemon CPU {:.1f} us/find\n",
             p50Alone, alone.percentile(0.99), cpuPerFind);
  fmt::print("resident:                 {} KiB alone, {} KiB with {} idle connections\n",
             residentAlone, residentIdle, options.idle);
  fmt::print(
      "find during the flood:    p50 {:.1f} us, p99 {:.1f} us ({} finds, {:.2f}x the p50 alone)\n",
      p50Flooded, flooded.percentile(0.99), flooded.micros.size(), p50Flooded / p50Alone);
  fmt::print(
      "flood:                    {} frames wanting no reply in {:.2f} s, daemon CPU {:.1f} "
      "us/request, peak resident {} KiB\n",
      options.flood, floodSeconds, cpuPerRequest, residentPeak);

  kill(ekd, SIGTERM);
  waitpid(ekd, nullptr, 0);
  for (int fd : idle) close(fd);
  fs::remove_all(root);
  return 0;
}
