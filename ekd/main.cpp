// ekd: the plug-in daemon.
#include <malloc.h>
#include <sys/resource.h>
#include <unistd.h>
#include <asio/io_context.hpp>
#include <asio/signal_set.hpp>

#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <iterator>
#include <optional>
#include <string>

#include "Ekora/EkProtocol.h"
#include "ekd/EkDServer.h"
#include "platform/log/Log.h"

namespace {

// A crash writes the log lines that still wait, then takes its course: through the handler
// that was there before (a sanitizer's, say), or the default action.
constexpr int kFatalSignals[] = {SIGABRT, SIGSEGV, SIGBUS, SIGFPE, SIGILL};
struct sigaction gPreviousActions[std::size(kFatalSignals)];

void onFatalSignal(int signal, siginfo_t* info, void* context) {
  ek::log::flushFromSignal();
  for (size_t i = 0; i < std::size(kFatalSignals); ++i) {
    if (kFatalSignals[i] != signal) continue;
    const struct sigaction& previous = gPreviousActions[i];
    if (previous.sa_flags & SA_SIGINFO) {
      previous.sa_sigaction(signal, info, context);
      return;
    }
    if (previous.sa_handler != SIG_DFL && previous.sa_handler != SIG_IGN) {
      previous.sa_handler(signal);
      return;
    }
  }
  ::signal(signal, SIG_DFL);
  ::raise(signal);
}

void flushLogOnCrash() {
  for (size_t i = 0; i < std::size(kFatalSignals); ++i) {
    struct sigaction action {};
    action.sa_sigaction = onFatalSignal;
    action.sa_flags = SA_SIGINFO | SA_NODEFER;
    sigemptyset(&action.sa_mask);
    sigaction(kFatalSignals[i], &action, &gPreviousActions[i]);
  }
}

void raiseDescriptorLimit() {
  struct rlimit files {};
  if (getrlimit(RLIMIT_NOFILE, &files) != 0 || files.rlim_cur == files.rlim_max) return;
  files.rlim_cur = files.rlim_max;
  if (setrlimit(RLIMIT_NOFILE, &files) != 0) {
    ek::log::ops().error("cannot raise the descriptor limit: %{errno}d", errno);
  }
}

[[noreturn]] void usage() {
  std::fputs("Usage: ekd [-S servicename] [-v]\n", stderr);
  std::exit(2);
}

}  // namespace

int main(int argc, char* argv[]) {
  using namespace ek;
  // One malloc arena for every thread. Requests, replies and records pass from thread to
  // thread, and with an arena per thread the memory each frees stays apart from the others':
  // the footprint then creeps up for long after start instead of levelling off.
  mallopt(M_ARENA_MAX, 1);
  // Under load, many requests' lines share one write; a reply still follows its lines when
  // no other request waits (see Transaction::prepareReply).
  log::bufferLines(std::chrono::milliseconds(10));
  flushLogOnCrash();
  log::ops().info("ekd is launching");

  std::string serviceName(protocol::kServiceName);
  std::optional<std::string> database;
  int cacheLimit = 1000000;
  unsigned verbose = 0;

  int option;
  while ((option = getopt(argc, argv, "c:d:S:v")) != -1) {
    switch (option) {
      case 'c':
        cacheLimit = std::atoi(optarg);
        break;
      case 'd':
        database = optarg;
        break;
      case 'S':
        serviceName = optarg;
        break;
      case 'v':
        ++verbose;
        log::ops().error(
            "verbose option -v is ineffective; use log config --subsystem com.corvane.ekora");
        break;
      case '?':
        usage();
      default:
        break;
    }
  }
  if (optind < argc) usage();

  // Every connection takes descriptors: use all the administrator allows, as the listener
  // sizes its connection limit by it.
  raiseDescriptorLimit();

  // Writes to a client that has gone must fail with EPIPE, not end the daemon.
  std::signal(SIGPIPE, SIG_IGN);

  // The main run loop: start-up and the termination signal run here.
  asio::io_context mainLoop;
  asio::signal_set termination(mainLoop, SIGTERM);

  auto server = EkDServer::initForService(serviceName, database);
  if (!server) {
    log::ops().error("unable to construct server");
    return 1;
  }
  server->setVerbose(verbose);
  server->setCacheLimit(static_cast<uint32_t>(cacheLimit));

  termination.async_wait([server](const asio::error_code& ec, int) {
    if (ec) return;
    server->stop();
    // Worker threads may still be mid-block; leave without running static destructors
    // under them. Everything acknowledged is already durable.
    log::flush();
    std::fflush(nullptr);
    _exit(0);
  });

  server->run();
  auto guard = asio::make_work_guard(mainLoop);
  mainLoop.run();
  return 0;
}
