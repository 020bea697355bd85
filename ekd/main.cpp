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
#include <cstring>
#include <functional>
#include <iterator>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "Ekora/EkProtocol.h"
#include "ekd/EkDServer.h"
#include "platform/log/Log.h"
#include "platform/paths/Directories.h"

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

#ifndef EKORA_VERSION
#define EKORA_VERSION "unknown"
#endif

// The long options stand alone: getopt would read "--help" as the unknown option '-'.
void answerLongOption(int argc, char* argv[]) {
  for (int i = 1; i < argc; ++i) {
    std::string_view argument = argv[i];
    if (argument == "--") return;
    if (argument == "--version") {
      std::printf("ekd %s\n", EKORA_VERSION);
      std::exit(0);
    }
    if (argument == "--help") {
      std::printf(
          "Usage: ekd [-S servicename] [-d annotation-file] [-c cache-limit] [-v]\n"
          "       ekd --help | --version\n"
          "\n"
          "The plug-in daemon: keeps the registry of installed plug-ins and answers the\n"
          "processes of one user over the socket $EKORA_RUNTIME_DIR/servicename.\n"
          "\n"
          "  -S servicename      service to listen on (default %s)\n"
          "  -d annotation-file  file of the user's per-plug-in choices\n"
          "                      (default $EKORA_STATE_DIR/Ekora-Annotations)\n"
          "  -c cache-limit      cached plug-in records kept without a purge (default 1000000)\n"
          "  -v                  no effect; log levels come from EKORA_LOG\n"
          "  --help              print this text and exit\n"
          "  --version           print the version and exit\n"
          "\n"
          "Directories for this user:\n"
          "  EKORA_RUNTIME_DIR  %s\n"
          "  EKORA_STATE_DIR    %s\n"
          "  EKORA_SYSTEM_ROOT  %s\n"
          "\n"
          "SIGTERM or SIGINT releases every hold, removes the socket and exits 0. SIGHUP\n"
          "registers the system volume's plug-ins as they are now. See ekd(8).\n",
          std::string(ek::protocol::kServiceName).c_str(), ek::paths::runtimeDir().c_str(),
          ek::paths::stateDir().c_str(), ek::paths::systemRoot().c_str());
      std::exit(0);
    }
  }
}

// A directory ekd must write to, made when missing. Absent when usable, else the reason.
std::optional<std::string> unusableDirectory(const std::string& directory) {
  if (auto made = ek::paths::ensureDirectory(directory); !made.ok()) return made.error().message;
  if (access(directory.c_str(), W_OK | X_OK) != 0) return std::strerror(errno);
  return std::nullopt;
}

}  // namespace

int main(int argc, char* argv[]) {
  using namespace ek;
  // One malloc arena for every thread. Requests, replies and records pass from thread to
  // thread, and with an arena per thread the memory each frees stays apart from the others':
  // the footprint then creeps up for long after start instead of levelling off.
  mallopt(M_ARENA_MAX, 1);
  // Many lines share one write: the default-level lines that requests log cost them no system
  // call; a reply still follows its diagnostic (info, debug) lines when no other request waits
  // (see Transaction::prepareReply).
  log::bufferLines(std::chrono::milliseconds(10));
  flushLogOnCrash();
  log::ops().info("ekd is launching");

  std::string serviceName(protocol::kServiceName);
  std::optional<std::string> database;
  int cacheLimit = 1000000;
  unsigned verbose = 0;

  answerLongOption(argc, argv);
  auto startTime = std::chrono::steady_clock::now();

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
  // An interactive ^C stops the daemon as cleanly as the service manager does.
  asio::signal_set termination(mainLoop, SIGTERM, SIGINT);

  // Without these the server cannot start; say which one and why instead of failing deep
  // inside start-up.
  const std::pair<const char*, std::string> directories[] = {{"state", ek::paths::stateDir()},
                                                             {"runtime", ek::paths::runtimeDir()}};
  for (const auto& [kind, directory] : directories) {
    if (auto reason = unusableDirectory(directory)) {
      log::ops().error("unusable %s directory %s: %s", kind, directory, *reason);
      return 1;
    }
  }

  auto server = EkDServer::initForService(serviceName, database);
  if (!server) {
    log::ops().error("unable to construct server");
    return 1;
  }
  server->setVerbose(verbose);
  server->database().setCacheLimit(static_cast<uint32_t>(cacheLimit));

  termination.async_wait([server](const asio::error_code& ec, int) {
    if (ec) return;
    server->stop();
    // Worker threads may still be mid-block; leave without running static destructors
    // under them. Everything acknowledged is already durable.
    log::flush();
    std::fflush(nullptr);
    _exit(0);
  });

  // SIGHUP (systemctl reload, ekctl rescan) registers the system volume's bundles as they
  // are now, as the watch on it does when bundles come and go.
  asio::signal_set reload(mainLoop, SIGHUP);
  std::function<void(const asio::error_code&, int)> onReload = [&](const asio::error_code& ec,
                                                                   int) {
    if (ec) return;
    log::vr().defaultLevel("SIGHUP: rescanning the system volume");
    server->rescanSystemVolume();
    reload.async_wait(onReload);
  };
  reload.async_wait(onReload);

  // The socket listens already (clients wait in its backlog): the line comes out before any
  // answer does. The plug-ins are those registered when the daemon last ran; the system
  // volume is read once the daemon serves, and a second line says when that is done.
  auto elapsed = std::chrono::duration_cast<std::chrono::milliseconds>(
      std::chrono::steady_clock::now() - startTime);
  log::ops().defaultLevel(
      "ekd %s listening on %s%s, %llu plug-ins registered, started in %llu ms; reading the "
      "system volume",
      EKORA_VERSION, server->service()->path(),
      server->service()->activated() ? " (socket-activated)" : "",
      static_cast<unsigned long long>(server->registry()->plugInCount()),
      static_cast<unsigned long long>(elapsed.count()));
  log::flush();
  server->run();
  auto guard = asio::make_work_guard(mainLoop);
  mainLoop.run();
  return 0;
}
