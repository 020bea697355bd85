// atomic_write_bench: the floor under a durable whole-file rewrite. It rewrites a file of a
// given size the way every durable store of the daemon does (temporary file in the same
// directory, write, fsync, rename over the target, fsync of the directory) and prints the
// median and p99 of the rewrites.
//
//   atomic_write_bench --like FILE [--count N] [--json]
//       rewrites FILE.atomic-bench, in FILE's directory (so on its file system), with FILE's
//       bytes; FILE itself is only read.

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "bench/LoadGenerator.h"

namespace {

constexpr int kSuccess = 0;
constexpr int kFailed = 1;
constexpr int kUsage = 2;
// The daemon's files are far smaller; a bound keeps a mistyped path from filling memory.
constexpr off_t kMaxFileSize = off_t{256} << 20;

bool fail(const std::string& what) {
  std::fprintf(stderr, "atomic_write_bench: %s: %s\n", what.c_str(), std::strerror(errno));
  return false;
}

bool readWhole(const std::string& path, std::string& bytes) {
  int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return fail(path);
  struct stat status;
  if (::fstat(fd, &status) != 0) {
    ::close(fd);
    return fail(path);
  }
  if (!S_ISREG(status.st_mode) || status.st_size > kMaxFileSize) {
    ::close(fd);
    errno = EFBIG;
    return fail(path + " (a regular file of at most 256 MiB is needed)");
  }
  bytes.resize(static_cast<size_t>(status.st_size));
  size_t done = 0;
  while (done < bytes.size()) {
    ssize_t n = ::read(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      ::close(fd);
      return fail(path);
    }
    done += static_cast<size_t>(n);
  }
  bytes.resize(done);
  ::close(fd);
  return true;
}

bool writeAll(int fd, const std::string& bytes) {
  size_t done = 0;
  while (done < bytes.size()) {
    ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

bool rewrite(const std::string& directory, const std::string& target, const std::string& bytes) {
  std::string temporary = target + ".XXXXXX";
  int fd = ::mkostemp(temporary.data(), O_CLOEXEC);
  if (fd < 0) return fail(temporary);
  if (!writeAll(fd, bytes) || ::fchmod(fd, 0644) != 0 || ::fsync(fd) != 0) {
    int saved = errno;
    ::close(fd);
    ::unlink(temporary.c_str());
    errno = saved;
    return fail(temporary);
  }
  if (::close(fd) != 0 || ::rename(temporary.c_str(), target.c_str()) != 0) {
    int saved = errno;
    ::unlink(temporary.c_str());
    errno = saved;
    return fail(target);
  }
  int directoryFd = ::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (directoryFd < 0) return fail(directory);
  bool synced = ::fsync(directoryFd) == 0;
  ::close(directoryFd);
  return synced || fail(directory);
}

}  // namespace

int main(int argc, char** argv) {
  std::string like;
  unsigned count = 200;
  bool json = false;
  CLI::App app{"atomic_write_bench: durable atomic rewrites of a file of a given size"};
  app.add_option("--like", like, "the file whose bytes and directory are used")->required();
  app.add_option("--count", count, "rewrites (default 200)")->check(CLI::Range(1u, 100000u));
  app.add_flag("--json", json, "print one JSON object");
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    int code = app.exit(e);
    return code == 0 ? kSuccess : kUsage;
  }

  std::string bytes;
  if (!readWhole(like, bytes)) return kFailed;
  size_t slash = like.rfind('/');
  std::string directory = slash == std::string::npos ? "."
                          : slash == 0               ? "/"
                                                     : like.substr(0, slash);
  std::string target = like + ".atomic-bench";

  using Clock = std::chrono::steady_clock;
  std::vector<uint64_t> nanoseconds;
  nanoseconds.reserve(count);
  for (unsigned i = 0; i < count; ++i) {
    Clock::time_point start = Clock::now();
    if (!rewrite(directory, target, bytes)) return kFailed;
    nanoseconds.push_back(static_cast<uint64_t>(
        std::chrono::duration_cast<std::chrono::nanoseconds>(Clock::now() - start).count()));
  }
  ::unlink(target.c_str());

  std::sort(nanoseconds.begin(), nanoseconds.end());
  auto micros = [&](double fraction) {
    return static_cast<double>(ek::bench::percentile(nanoseconds, fraction)) / 1000.0;
  };
  if (json) {
    fmt::print(
        R"({{"bytes":{},"rewrites":{},"latency_us":{{"p50":{:.1f},"p99":{:.1f},"max":{:.1f}}}}})"
        "\n",
        bytes.size(), count, micros(0.5), micros(0.99), micros(1.0));
  } else {
    fmt::print(
        "atomic rewrite of {} bytes in {}: {} rewrites, p50 {:.1f} µs, p99 {:.1f} µs, max {:.1f} "
        "µs\n",
        bytes.size(), directory, count, micros(0.5), micros(0.99), micros(1.0));
  }
  return kSuccess;
}
