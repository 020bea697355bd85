#include "platform/stard/ServiceManager.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <fmt/format.h>
#include <signal.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <charconv>
#include <cstdlib>
#include <filesystem>
#include <limits>
#include <unordered_map>
#include <utility>

#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"
#include "platform/paths/Directories.h"
#include "platform/process/Process.h"

extern char** environ;

namespace ek::stard {
namespace {

constexpr std::string_view kHostPidKey = "host-pid";
constexpr std::string_view kHostPathKey = "host-path";
constexpr std::string_view kProgramKey = "program";
constexpr std::string_view kOverlayKey = "overlay";
constexpr std::string_view kPidKey = "pid";
constexpr std::string_view kStartTimeKey = "start-time";
constexpr std::string_view kServiceKey = "WyreService";
constexpr std::string_view kEnvironmentKey = "EnvironmentVariables";

constexpr std::string_view kExtension = ".dmap";
// NAME_MAX less the extension and the atomic writer's temporary-name decoration
// (".<name>.XXXXXX"), so that every file made for an identifier is still one file name.
constexpr size_t kMaxIdentifierLength =
    255 - kExtension.size() - std::string_view("..XXXXXX").size();
// Instance entries are a handful of short fields; anything larger is not ours.
constexpr off_t kMaxEntrySize = 64 * 1024;
constexpr size_t kMaxEntriesPerIdentifier = 4096;
// /proc/<pid>/stat is one line well under this.
constexpr size_t kMaxStatSize = 4096;

bool validIdentifier(std::string_view identifier) {
  return !identifier.empty() && identifier.size() <= kMaxIdentifierLength && identifier != "." &&
         identifier != ".." && identifier.find('/') == std::string_view::npos &&
         identifier.find('\0') == std::string_view::npos;
}

// The errno value an error carries, for operations that answer an integer.
int errnoOf(const EkError& error) {
  if (error.domain == kPosixErrorDomain && error.code != 0) return error.code;
  if (error.domain == kFormatErrorDomain) return EINVAL;
  return EIO;
}

std::optional<pid_t> parsePid(std::string_view text) {
  pid_t pid = 0;
  auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), pid);
  if (ec != std::errc() || end != text.data() + text.size() || pid <= 0) return std::nullopt;
  return pid;
}

std::optional<pid_t> pidOfValue(const Value* value) {
  if (value == nullptr || value->unsignedNumber() == nullptr) return std::nullopt;
  uint64_t number = *value->unsignedNumber();
  if (number == 0 || number > static_cast<uint64_t>(std::numeric_limits<pid_t>::max())) {
    return std::nullopt;
  }
  return static_cast<pid_t>(number);
}

struct ProcStat {
  char state = '?';
  uint64_t startTime = 0;  // clock ticks after boot

  // A zombie has exited; only its parent's wait keeps the pid.
  bool running() const { return state != 'Z' && state != 'X' && state != 'x'; }
};

// Reads /proc/<pid>/stat. Absent with errno set when it cannot be read or parsed.
std::optional<ProcStat> readProcStat(pid_t pid) {
  std::string path = fmt::format("/proc/{}/stat", pid);
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) return std::nullopt;
  char buffer[kMaxStatSize];
  size_t length = 0;
  while (length < sizeof buffer) {
    ssize_t n = ::read(fd.get(), buffer + length, sizeof buffer - length);
    if (n < 0) {
      if (errno == EINTR) continue;
      return std::nullopt;
    }
    if (n == 0) break;
    length += static_cast<size_t>(n);
  }
  std::string_view line(buffer, length);
  // The command name (field 2) is in parentheses and may itself hold spaces and parentheses.
  size_t close = line.rfind(')');
  if (close == std::string_view::npos) {
    errno = EINVAL;
    return std::nullopt;
  }
  line.remove_prefix(close + 1);
  // Fields from 3 (state) on, separated by single spaces; the start time is field 22.
  ProcStat stat;
  int field = 2;
  while (!line.empty()) {
    while (!line.empty() && line.front() == ' ') line.remove_prefix(1);
    size_t end = line.find_first_of(" \n");
    std::string_view token = line.substr(0, end);
    line.remove_prefix(end == std::string_view::npos ? line.size() : end);
    if (token.empty()) break;
    ++field;
    if (field == 3) {
      stat.state = token.front();
    } else if (field == 22) {
      auto [ptr, ec] = std::from_chars(token.data(), token.data() + token.size(), stat.startTime);
      if (ec != std::errc() || ptr != token.data() + token.size()) break;
      return stat;
    }
  }
  errno = EINVAL;
  return std::nullopt;
}

// Whether a process with this pid is still running (a zombie is not).
bool processAlive(pid_t pid) {
  if (auto stat = readProcStat(pid)) return stat->running();
  if (errno == ENOENT || errno == ESRCH) return false;
  // /proc unreadable for another reason: ask the kernel directly.
  return !(::kill(pid, 0) == -1 && errno == ESRCH);
}

// Reads a small regular file without following a link; absent with errno set otherwise.
// EFBIG for a file above the bound.
std::optional<std::string> readSmallFile(const std::string& path, off_t limit) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
  if (!fd.valid()) return std::nullopt;
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0) return std::nullopt;
  if (!S_ISREG(st.st_mode)) {
    errno = EINVAL;
    return std::nullopt;
  }
  if (st.st_size > limit) {
    errno = EFBIG;
    return std::nullopt;
  }
  std::string bytes(static_cast<size_t>(st.st_size), '\0');
  size_t length = 0;
  while (length < bytes.size()) {
    ssize_t n = ::read(fd.get(), bytes.data() + length, bytes.size() - length);
    if (n < 0) {
      if (errno == EINTR) continue;
      return std::nullopt;
    }
    if (n == 0) break;
    length += static_cast<size_t>(n);
  }
  bytes.resize(length);
  return bytes;
}

// One row of the instance table as found on disk.
struct Entry {
  Instance instance;
  uint64_t startTime = 0;
  std::string path;
};

// The entry in a file, or absent when the file is not a well-formed entry for that pid.
std::optional<Entry> parseEntry(const std::string& path, pid_t pidOfName,
                                std::string_view bundleIdentifier) {
  auto bytes = readSmallFile(path, kMaxEntrySize);
  if (!bytes) return std::nullopt;
  auto value = dmap::parse(*bytes);
  if (!value.ok() || value->dictionary() == nullptr) {
    errno = EINVAL;  // the content's fault, not a vanished file's
    return std::nullopt;
  }
  auto pid = pidOfValue(value->get(kPidKey));
  auto hostPid = pidOfValue(value->get(kHostPidKey));
  const uint64_t* startTime = value->getUnsigned(kStartTimeKey);
  const std::string* program = value->getString(kProgramKey);
  if (!pid || *pid != pidOfName || !hostPid || startTime == nullptr || program == nullptr) {
    errno = EINVAL;
    return std::nullopt;
  }
  Entry entry;
  entry.instance.pid = *pid;
  entry.instance.bundleIdentifier = std::string(bundleIdentifier);
  entry.instance.hostPid = *hostPid;
  entry.instance.program = *program;
  entry.startTime = *startTime;
  entry.path = path;
  return entry;
}

// Sends SIGTERM to the entry's process if it is still the one recorded. 0 when signalled,
// ESRCH when it is gone, another errno value when it could not be signalled.
int terminate(const Entry& entry) {
  const pid_t pid = entry.instance.pid;
  // Holding a pidfd pins the identity: once the start time read after opening it matches,
  // the signal cannot reach a process that took over a recycled pid.
  UniqueFd pidfd(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
  const bool havePidfd = pidfd.valid();
  if (!havePidfd && errno != ENOSYS) return errno == ESRCH ? ESRCH : errno;
  auto stat = readProcStat(pid);
  if (!stat || !stat->running() || stat->startTime != entry.startTime) return ESRCH;
  int result =
      havePidfd
          ? static_cast<int>(::syscall(SYS_pidfd_send_signal, pidfd.get(), SIGTERM, nullptr, 0))
          : ::kill(pid, SIGTERM);
  if (result != 0) return errno;
  return 0;
}

}  // namespace

FileServiceManager::FileServiceManager(std::string runtimeDirectory)
    : runtimeDirectory_(runtimeDirectory.empty() ? paths::runtimeDir()
                                                 : std::move(runtimeDirectory)) {}

namespace {

std::string servicesDirectory(const std::string& runtime) {
  return paths::join(runtime, "services");
}

std::string instancesDirectory(const std::string& runtime, std::string_view bundleIdentifier) {
  return paths::join(paths::join(runtime, "instances"), bundleIdentifier);
}

std::string declarationPath(const std::string& runtime, pid_t hostPid,
                            std::string_view bundleIdentifier) {
  return paths::join(paths::join(servicesDirectory(runtime), std::to_string(hostPid)),
                     fmt::format("{}{}", bundleIdentifier, kExtension));
}

// The names in a directory other than "." and "..", at most limit of them; empty when the
// directory cannot be opened.
std::vector<std::string> listDirectory(const std::string& path,
                                       size_t limit = std::numeric_limits<size_t>::max()) {
  std::vector<std::string> names;
  DIR* dir = ::opendir(path.c_str());
  if (dir == nullptr) return names;
  while (names.size() < limit) {
    errno = 0;
    struct dirent* item = ::readdir(dir);
    if (item == nullptr) break;
    std::string_view name = item->d_name;
    if (name == "." || name == "..") continue;
    names.emplace_back(name);
  }
  ::closedir(dir);
  return names;
}

void pruneDeclarationsIn(const std::string& runtime) {
  const std::string services = servicesDirectory(runtime);
  for (const std::string& name : listDirectory(services)) {
    auto hostPid = parsePid(name);
    if (!hostPid || processAlive(*hostPid)) continue;
    std::error_code error;
    std::filesystem::remove_all(paths::join(services, name), error);
    if (error) {
      log::ops().error("cannot remove declarations of exited host %d: %s", *hostPid,
                       error.message());
    }
  }
}

// The live entries of a bundle identifier. Entries of processes that are gone or are not the
// recorded ones, and files that are not entries, are removed on the way.
std::vector<Entry> liveEntries(const std::string& runtime, std::string_view bundleIdentifier) {
  std::vector<Entry> entries;
  const std::string directory = instancesDirectory(runtime, bundleIdentifier);
  for (const std::string& name : listDirectory(directory, kMaxEntriesPerIdentifier)) {
    // Temporary files of a write in progress start with a dot.
    if (name.front() == '.') continue;
    const std::string path = paths::join(directory, name);
    std::optional<pid_t> pid;
    if (name.size() > kExtension.size() && name.ends_with(kExtension)) {
      pid = parsePid(std::string_view(name).substr(0, name.size() - kExtension.size()));
    }
    std::optional<Entry> entry;
    errno = EINVAL;
    if (pid) entry = parseEntry(path, *pid, bundleIdentifier);
    if (!entry) {
      if (errno == ENOENT) continue;  // removed meanwhile
      log::ops().error("removing malformed instance entry %s", path);
      ::unlink(path.c_str());
      continue;
    }
    auto stat = readProcStat(entry->instance.pid);
    if (!stat || !stat->running() || stat->startTime != entry->startTime) {
      ::unlink(path.c_str());
      continue;
    }
    entries.push_back(std::move(*entry));
  }
  return entries;
}

}  // namespace

int FileServiceManager::addExternalService(pid_t hostPid, std::string_view hostPath,
                                           std::string_view bundleIdentifier,
                                           std::string_view program, const Dictionary& overlay) {
  if (hostPid <= 0 || !validIdentifier(bundleIdentifier)) return EINVAL;
  Dictionary declaration{
      {std::string(kHostPidKey), Value(hostPid)},
      {std::string(kHostPathKey), Value(hostPath)},
      {std::string(kProgramKey), Value(program)},
      {std::string(kOverlayKey), Value(overlay)},
  };
  auto bytes = dmap::write(Value(std::move(declaration)));
  if (!bytes.ok()) return EINVAL;

  std::lock_guard lock(mutex_);
  pruneDeclarationsIn(runtimeDirectory_);
  const std::string path = declarationPath(runtimeDirectory_, hostPid, bundleIdentifier);
  auto made = paths::ensureDirectory(
      paths::join(servicesDirectory(runtimeDirectory_), std::to_string(hostPid)), 0755);
  if (!made.ok()) return errnoOf(made.error());
  auto written = dmap::writeBytesAtomically(path, *bytes, 0644, dmap::Durability::RuntimeOnly);
  if (!written.ok()) return errnoOf(written.error());
  return kSuccess;
}

void FileServiceManager::removeExternalService(std::string_view bundleIdentifier,
                                               std::string_view version,
                                               std::shared_ptr<SerialQueue> queue,
                                               std::function<void(int)> answer) {
  if (!queue) std::abort();  // an answer with nowhere to go is a caller's broken invariant
  int code = EINVAL;
  if (validIdentifier(bundleIdentifier)) {
    std::lock_guard lock(mutex_);
    int failure = 0;
    const std::string services = servicesDirectory(runtimeDirectory_);
    const std::string file = fmt::format("{}{}", bundleIdentifier, kExtension);
    for (const std::string& host : listDirectory(services)) {
      if (!parsePid(host)) continue;
      std::string path = paths::join(paths::join(services, host), file);
      if (::unlink(path.c_str()) != 0 && errno != ENOENT && errno != ENOTDIR) failure = errno;
    }

    int signalled = 0;
    for (const Entry& entry : liveEntries(runtimeDirectory_, bundleIdentifier)) {
      int result = terminate(entry);
      if (result == 0) {
        ++signalled;
        log::ops().debug("sent SIGTERM to %s instance pid %d (version %s)", bundleIdentifier,
                         entry.instance.pid, version);
      } else if (result != ESRCH) {
        log::ops().error("cannot end %s instance pid %d: %{errno}d", bundleIdentifier,
                         entry.instance.pid, result);
        failure = result;
        continue;
      }
      // Signalled or gone: the entry is done either way.
      ::unlink(entry.path.c_str());
    }
    ::rmdir(instancesDirectory(runtimeDirectory_, bundleIdentifier).c_str());
    code = failure != 0 ? failure : signalled > 0 ? kSuccess : kNoSuchProcess;
  }
  queue->async([answer = std::move(answer), code] {
    if (answer) answer(code);
  });
}

Result<pid_t> FileServiceManager::launch(pid_t hostPid, std::string_view bundleIdentifier,
                                         const std::vector<std::string>& arguments) {
  if (hostPid <= 0 || !validIdentifier(bundleIdentifier)) {
    return EkError::posix(EINVAL, "launch: invalid host pid or bundle identifier");
  }
  std::lock_guard lock(mutex_);
  auto read = dmap::readFile(declarationPath(runtimeDirectory_, hostPid, bundleIdentifier));
  if (!read.ok()) {
    if (read.error().isPosix(ENOENT)) {
      return EkError::posix(
          ENOENT, fmt::format("no declaration of {} for host {}", bundleIdentifier, hostPid));
    }
    return std::move(read).error();
  }
  const Value& declaration = *read;
  const std::string* program = declaration.getString(kProgramKey);
  if (program == nullptr || program->empty() || program->find('\0') != std::string::npos) {
    return EkError::posix(EINVAL, fmt::format("declaration of {} for host {} has no program",
                                              bundleIdentifier, hostPid));
  }

  std::vector<std::string> argvStrings;
  argvStrings.reserve(arguments.size() + 1);
  argvStrings.push_back(*program);
  for (const std::string& argument : arguments) {
    if (argument.find('\0') != std::string::npos) {
      return EkError::posix(EINVAL, "launch: argument holds a NUL byte");
    }
    argvStrings.push_back(argument);
  }

  // The daemon's environment, then the overlay's variables over it.
  std::vector<std::string> environmentStrings;
  std::unordered_map<std::string, size_t> byName;
  for (char** item = environ; item != nullptr && *item != nullptr; ++item) {
    std::string_view text = *item;
    std::string name(text.substr(0, text.find('=')));
    auto [it, inserted] = byName.emplace(name, environmentStrings.size());
    if (inserted) {
      environmentStrings.emplace_back(text);
    } else {
      environmentStrings[it->second] = std::string(text);
    }
  }
  const Value* overlay = declaration.get(kOverlayKey);
  const Value* service = overlay != nullptr ? overlay->get(kServiceKey) : nullptr;
  const Dictionary* variables =
      service != nullptr ? service->getDictionary(kEnvironmentKey) : nullptr;
  if (variables != nullptr) {
    for (const auto& [name, value] : *variables) {
      const std::string* text = value.string();
      if (text == nullptr || name.empty() ||
          name.find_first_of(std::string_view("=\0", 2)) != std::string::npos ||
          text->find('\0') != std::string::npos) {
        continue;
      }
      std::string assignment = fmt::format("{}={}", name, *text);
      auto [it, inserted] = byName.emplace(name, environmentStrings.size());
      if (inserted) {
        environmentStrings.push_back(std::move(assignment));
      } else {
        environmentStrings[it->second] = std::move(assignment);
      }
    }
  }

  std::vector<char*> argv;
  for (std::string& text : argvStrings) argv.push_back(text.data());
  argv.push_back(nullptr);
  std::vector<char*> envp;
  for (std::string& text : environmentStrings) envp.push_back(text.data());
  envp.push_back(nullptr);

  // The child starts clean: no blocked or ignored signals of the daemon's threads (a blocked
  // SIGTERM would make it unkillable by removal), and none of the daemon's descriptors.
  posix_spawnattr_t attributes;
  posix_spawnattr_init(&attributes);
  sigset_t none;
  sigemptyset(&none);
  sigset_t all;
  sigfillset(&all);
  posix_spawnattr_setsigmask(&attributes, &none);
  posix_spawnattr_setsigdefault(&attributes, &all);
  posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addclosefrom_np(&actions, STDERR_FILENO + 1);
  pid_t pid = 0;
  int spawned =
      ::posix_spawn(&pid, program->c_str(), &actions, &attributes, argv.data(), envp.data());
  posix_spawn_file_actions_destroy(&actions);
  posix_spawnattr_destroy(&attributes);
  if (spawned != 0) return EkError::fromErrno(spawned, fmt::format("launch {}", *program));

  // The child is ours and unreaped, so its pid still names it here.
  auto stat = readProcStat(pid);
  auto fail = [&](EkError error) -> Result<pid_t> {
    // An instance we cannot record could never be ended through removal: end it now.
    ::kill(pid, SIGKILL);
    while (::waitpid(pid, nullptr, 0) < 0 && errno == EINTR) {
    }
    return error;
  };
  if (!stat) return fail(EkError::fromErrno(errno, fmt::format("read start time of {}", pid)));
  Dictionary entry{
      {std::string(kPidKey), Value(pid)},
      {std::string(kStartTimeKey), Value(stat->startTime)},
      {std::string(kHostPidKey), Value(hostPid)},
      {std::string(kProgramKey), Value(*program)},
  };
  const std::string directory = instancesDirectory(runtimeDirectory_, bundleIdentifier);
  auto made = paths::ensureDirectory(directory, 0755);
  if (!made.ok()) return fail(std::move(made).error());
  auto written =
      dmap::writeFileAtomically(paths::join(directory, fmt::format("{}{}", pid, kExtension)),
                                Value(std::move(entry)), 0644, dmap::Durability::RuntimeOnly);
  if (!written.ok()) return fail(std::move(written).error());
  log::ops().debug("launched %s for host %d: pid %d", bundleIdentifier, hostPid, pid);
  return pid;
}

std::vector<Instance> FileServiceManager::instances(
    const std::vector<std::string>& bundleIdentifiers) {
  std::vector<Instance> result;
  std::lock_guard lock(mutex_);
  for (const std::string& bundleIdentifier : bundleIdentifiers) {
    if (!validIdentifier(bundleIdentifier)) continue;
    for (Entry& entry : liveEntries(runtimeDirectory_, bundleIdentifier)) {
      result.push_back(std::move(entry.instance));
    }
  }
  return result;
}

void FileServiceManager::pruneDeclarations() {
  std::lock_guard lock(mutex_);
  pruneDeclarationsIn(runtimeDirectory_);
}

std::optional<Dictionary> FileServiceManager::declaration(pid_t hostPid,
                                                          std::string_view bundleIdentifier) const {
  if (hostPid <= 0 || !validIdentifier(bundleIdentifier)) return std::nullopt;
  std::lock_guard lock(mutex_);
  auto read = dmap::readFile(declarationPath(runtimeDirectory_, hostPid, bundleIdentifier));
  if (!read.ok() || read->dictionary() == nullptr) return std::nullopt;
  return std::move(*read->dictionary());
}

}  // namespace ek::stard
