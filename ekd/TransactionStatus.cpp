// The "status" request: what an administrator asks of a running daemon (ekctl status).

#include <unistd.h>

#include <chrono>

#include "Ekora/EkProtocol.h"
#include "ekd/EkDServer.h"
#include "ekd/Handlers.h"
#include "platform/paths/Directories.h"

#ifndef EKORA_VERSION
#define EKORA_VERSION "unknown"
#endif

namespace ek::handlers {

Reply reportStatus(const Request&, EkDServer& daemon) {
  Reply reply;
  Dictionary& members = reply.members;
  auto uptime = std::chrono::steady_clock::now() - daemon.startTime();
  members["version"] = Value(EKORA_VERSION);
  members["pid"] = Value(static_cast<uint64_t>(::getpid()));
  members["uptime"] = Value(std::chrono::duration<double>(uptime).count());
  members["socket"] = Value(daemon.service()->path());
  members["state"] = Value(paths::stateDir());
  members["system"] = Value(paths::systemRoot());
  members["plugins"] = Value(static_cast<uint64_t>(daemon.registry()->plugInCount()));
  members["scanning"] = Value(daemon.scanning());
  members["connections"] = Value(static_cast<uint64_t>(daemon.service()->connectionCount()));
  members["holds"] = Value(static_cast<uint64_t>(daemon.holdCount()));
  return reply;
}

}  // namespace ek::handlers
