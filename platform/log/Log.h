#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <limits>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <variant>

#include "platform/value/EkError.h"
#include "platform/value/Uuid.h"
#include "platform/value/Value.h"

namespace ek::log {

enum class Level : uint8_t { Default, Info, Debug, Error };

std::string_view levelName(Level level);

// One argument of a log message. Built only when the message's level is enabled.
class Arg {
 public:
  using Storage = std::variant<int64_t, uint64_t, double, std::string_view, std::string>;

  template <typename T>
  requires(std::is_integral_v<T> && !std::is_same_v<T, bool>) Arg(T n) : storage_(widen(n)) {}
  Arg(bool b) : storage_(std::string_view(b ? "true" : "false")) {}
  Arg(double d) : storage_(d) {}
  Arg(const char* s) : storage_(std::string_view(s ? s : "(null)")) {}
  Arg(std::string_view s) : storage_(s) {}
  Arg(const std::string& s) : storage_(std::string_view(s)) {}
  Arg(const void* p) : storage_(static_cast<uint64_t>(reinterpret_cast<uintptr_t>(p))) {}
  Arg(const Value& v) : storage_(v.description()) {}
  Arg(const EkError& e) : storage_(std::string_view(e.message)) {}
  Arg(const Uuid& u) : storage_(u.string()) {}
  // Anything with a description(), such as the daemon's records.
  template <typename T>
  requires requires(const T& t) {
    { t.description() } -> std::convertible_to<std::string>;
  } &&(!std::is_same_v<T, Value>)&&(!std::is_same_v<T, EkError>)Arg(const T& t)
      : storage_(std::string(t.description())) {
  }

  const Storage& storage() const { return storage_; }

 private:
  template <typename T>
  static Storage widen(T n) {
    if constexpr (std::is_signed_v<T>) {
      return static_cast<int64_t>(n);
    } else {
      return static_cast<uint64_t>(n);
    }
  }

  Storage storage_;
};

// Renders a message in the daemon's format strings: %d %i %u %x %lx %llu %s %@ %p %f %%,
// with optional {public}/{private} annotations, %{errno}d and %{uuid_t}.16P (16 bytes given as
// a Uuid argument). A missing argument renders as "(null)".
std::string formatMessage(std::string_view format, std::span<const Arg> args);

// Formats a message in the same format language, for error messages built from the
// system's format strings.
template <typename... Args>
std::string format(std::string_view fmt, const Args&... args) {
  if constexpr (sizeof...(Args) == 0) {
    return formatMessage(fmt, {});
  } else {
    const Arg list[] = {Arg(args)...};
    return formatMessage(fmt, std::span<const Arg>(list, sizeof...(Args)));
  }
}

// What one log line carries; sinks decide how to write it.
struct Record {
  Level level;
  std::string_view subsystem;  // empty for the plain process log
  std::string_view category;
  std::string_view message;
};

// One line as written to standard error, with its newline:
// "2026-11-23T10:04:05.123Z ekd[4242] debug com.corvane.Ekora:ops: message", or for the plain
// process log "2026-11-23T10:04:05.123Z ekd[4242]: message".
std::string formatLine(const Record& record, std::chrono::system_clock::time_point when,
                       std::string_view program, int pid);

class Sink {
 public:
  virtual ~Sink() = default;
  virtual void write(const Record& record) = 0;
  // Writes whatever the sink holds back.
  virtual void flush() {}
};

// Replaces where lines go (standard error or the journal by default). Tests install a
// capturing sink; nullptr restores the default.
void setSink(std::shared_ptr<Sink> sink);

// From now on, lines to standard error below the error level may wait up to delay, so that a
// busy process writes many lines with one write. An error line writes every line before it
// at once, as do flush(), a backlog of 64 KiB and exit through std::exit; a process leaving
// with _exit calls flush() first. Lines keep their order and their time of logging. The
// journal takes each line as it comes.
void bufferLines(std::chrono::milliseconds delay);
// Writes every line that waits. Thread-safe.
void flush();
// Writes the waiting lines when one of them is an info or debug line (logged only while
// someone diagnoses): a server calls it before each reply, so that those lines come before the
// reply, while the default-level lines that every request logs wait for the next batch and
// cost the request no system call. Thread-safe.
void flushDiagnostics();
// flush() for a handler of a fatal signal: gives the waiting lines up rather than wait for a
// thread that the signal may have stopped while it held them.
void flushFromSignal();

// Re-reads the enabled levels, written in EKORA_LOG's syntax
// ("debug", "info", "ops:debug,vr:info"). The environment is read on first use.
void configure(std::string_view levels);

// Keeps repeated lines of one kind to one a second: the first line of each second is written,
// the others are counted, and the next line written says how many were left out. One
// throttle per kind of line (a static beside the call). Thread-safe.
class Throttle {
 public:
  using Clock = std::chrono::steady_clock;
  explicit Throttle(Clock::duration interval = std::chrono::seconds(1)) : interval_(interval) {}

  // Whether a line may be written at now; when it may, *suppressed is the number of lines held
  // back since the last one written.
  bool admit(uint64_t* suppressed, Clock::time_point now = Clock::now());

 private:
  const Clock::duration interval_;
  std::atomic<int64_t> nextAllowed_{std::numeric_limits<int64_t>::min()};
  std::atomic<uint64_t> suppressed_{0};
};

// A log category of a subsystem. Thread-safe.
class Category {
 public:
  Category(std::string subsystem, std::string name);
  Category(const Category& other);
  Category& operator=(const Category&) = delete;
  ~Category();

  bool enabled(Level level) const {
    return (enabledMask_.load(std::memory_order_relaxed) >> static_cast<unsigned>(level)) & 1u;
  }

  template <typename... Args>
  void log(Level level, std::string_view format, const Args&... args) const {
    if (!enabled(level)) return;
    if constexpr (sizeof...(Args) == 0) {
      write(level, format, {});
    } else {
      const Arg list[] = {Arg(args)...};
      write(level, format, std::span<const Arg>(list, sizeof...(Args)));
    }
  }
  // log, at most one line a second through throttle; a line written after others were held
  // back ends with " (N similar messages suppressed)".
  template <typename... Args>
  void throttled(Throttle& throttle, Level level, std::string_view format,
                 const Args&... args) const {
    if (!enabled(level)) return;
    uint64_t suppressed = 0;
    if (!throttle.admit(&suppressed)) return;
    if constexpr (sizeof...(Args) == 0) {
      write(level, format, {}, suppressed);
    } else {
      const Arg list[] = {Arg(args)...};
      write(level, format, std::span<const Arg>(list, sizeof...(Args)), suppressed);
    }
  }
  template <typename... Args>
  void defaultLevel(std::string_view format, const Args&... args) const {
    log(Level::Default, format, args...);
  }
  template <typename... Args>
  void info(std::string_view format, const Args&... args) const {
    log(Level::Info, format, args...);
  }
  template <typename... Args>
  void debug(std::string_view format, const Args&... args) const {
    log(Level::Debug, format, args...);
  }
  template <typename... Args>
  void error(std::string_view format, const Args&... args) const {
    log(Level::Error, format, args...);
  }

  const std::string& subsystem() const { return subsystem_; }
  const std::string& name() const { return name_; }

 private:
  void write(Level level, std::string_view format, std::span<const Arg> args,
             uint64_t suppressed = 0) const;

  friend class Registry;

  std::string subsystem_;
  std::string name_;
  // One bit per Level, recomputed by configure().
  std::atomic<uint8_t> enabledMask_{0};
};

inline constexpr std::string_view kSubsystem = "com.corvane.Ekora";

// The daemon's categories, each made once on first use.
const Category& ops();
const Category& traffic();
const Category& extension();
const Category& vr();
const Category& sandbox();
// The plain process log, without subsystem.
const Category& process();

}  // namespace ek::log
