#pragma once

#include <sys/types.h>

#include <string>
#include <string_view>

#include "platform/value/Result.h"

namespace ek::paths {

// EKORA_RUNTIME_DIR, else /run/ekora for root, $XDG_RUNTIME_DIR/ekora or /tmp/ekora-<uid>.
std::string runtimeDir();
// EKORA_STATE_DIR, else /var/lib/ekora for root, $XDG_STATE_HOME/ekora or ~/.local/state/ekora.
std::string stateDir();
// The two above as they are for user uid; those ask for the effective user.
std::string runtimeDir(uid_t uid);
std::string stateDir(uid_t uid);
// EKORA_SYSTEM_ROOT, else /usr/lib/ekora.
std::string systemRoot();

// The socket of the Wyre service named name.
std::string servicePath(std::string_view name);
// The directory where notification files live.
std::string notificationsDir();

// Creates a directory and its missing parents (mode for the ones it makes).
Result<void> ensureDirectory(const std::string& path, mode_t mode = 0755);

// Joins two path pieces with one slash.
std::string join(std::string_view a, std::string_view b);

}  // namespace ek::paths
