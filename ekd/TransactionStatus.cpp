// The "status" request: what an administrator asks of a running daemon (ekctl status).

#include <unistd.h>

#include <chrono>

#include "Ekora/EkProtocol.h"
#include "ekd/EkDServer.h"
#include "ekd/Transaction.h"
#include "platform/paths/Directories.h"

#ifndef EKORA_VERSION
#define EKORA_VERSION "unknown"
#endif

namespace ek {

void Transaction::reportStatus() {
  EkDServer& daemon = server();
  auto uptime = std::chrono::steady_clock::now() - daemon.startTime();
  reply()["version"] = Value(EKORA_VERSION);
  reply()["pid"] = Value(static_cast<uint64_t>(::getpid()));
  reply()["uptime"] = Value(std::chrono::duration<double>(uptime).count());
  reply()["socket"] = Value(daemon.service()->path());
  reply()["state"] = Value(paths::stateDir());
  reply()["system"] = Value(paths::systemRoot());
  reply()["plugins"] = Value(static_cast<uint64_t>(daemon.registry()->plugInCount()));
  reply()["scanning"] = Value(daemon.scanning());
  reply()["connections"] = Value(static_cast<uint64_t>(daemon.service()->connectionCount()));
  reply()["holds"] = Value(static_cast<uint64_t>(daemon.holdCount()));
  done();
}

}  // namespace ek
