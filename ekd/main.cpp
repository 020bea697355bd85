// ekd: the plug-in daemon.
#include <malloc.h>
#include <unistd.h>
#include <asio/io_context.hpp>
#include <asio/signal_set.hpp>

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <optional>
#include <string>

#include "Ekora/EkProtocol.h"
#include "ekd/EkDServer.h"
#include "platform/log/Log.h"

namespace {

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
    std::fflush(nullptr);
    _exit(0);
  });

  server->run();
  auto guard = asio::make_work_guard(mainLoop);
  mainLoop.run();
  return 0;
}
