#include "platform/log/Log.h"

#include <errno.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <syslog.h>
#include <systemd/sd-journal.h>
#include <time.h>
#include <unistd.h>

#include <pthread.h>

#include <algorithm>
#include <atomic>
#include <cctype>
#include <charconv>
#include <condition_variable>
#include <cstdlib>
#include <limits>
#include <map>
#include <mutex>
#include <optional>
#include <thread>
#include <vector>

namespace ek::log {
namespace {

constexpr uint8_t bit(Level level) {
  return uint8_t(1u << static_cast<unsigned>(level));
}

// What a level name in EKORA_LOG turns on: the level and everything less verbose.
constexpr uint8_t kErrorMask = bit(Level::Error);
constexpr uint8_t kDefaultMask = kErrorMask | bit(Level::Default);
constexpr uint8_t kInfoMask = kDefaultMask | bit(Level::Info);
constexpr uint8_t kDebugMask = kInfoMask | bit(Level::Debug);

std::optional<uint8_t> maskForName(std::string_view name) {
  std::string lower(name);
  std::transform(lower.begin(), lower.end(), lower.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  if (lower == "error") return kErrorMask;
  if (lower == "default") return kDefaultMask;
  if (lower == "info") return kInfoMask;
  if (lower == "debug") return kDebugMask;
  return std::nullopt;
}

std::string_view trim(std::string_view s) {
  while (!s.empty() && std::isspace(static_cast<unsigned char>(s.front()))) s.remove_prefix(1);
  while (!s.empty() && std::isspace(static_cast<unsigned char>(s.back()))) s.remove_suffix(1);
  return s;
}

// Enabled levels: one for every category, and overrides by category name.
struct Settings {
  uint8_t all = kDefaultMask;
  std::map<std::string, uint8_t, std::less<>> byCategory;

  // "debug", "ops:debug,vr:info", or both ("info,ops:debug"). Unknown entries are ignored:
  // a typo in the environment must not stop the daemon.
  static Settings parse(std::string_view spec) {
    Settings settings;
    while (!spec.empty()) {
      size_t comma = spec.find(',');
      std::string_view entry = trim(spec.substr(0, comma));
      spec = comma == std::string_view::npos ? std::string_view() : spec.substr(comma + 1);
      size_t colon = entry.rfind(':');
      if (colon == std::string_view::npos) {
        if (auto mask = maskForName(entry)) settings.all = *mask;
        continue;
      }
      std::string_view category = trim(entry.substr(0, colon));
      if (auto mask = maskForName(trim(entry.substr(colon + 1))); mask && !category.empty()) {
        settings.byCategory[std::string(category)] = *mask;
      }
    }
    return settings;
  }

  uint8_t maskFor(std::string_view category) const {
    auto it = byCategory.find(category);
    return it == byCategory.end() ? all : it->second;
  }
};

}  // namespace

// Every live category, so that configure() can recompute their levels. Never destroyed:
// categories may log while other static objects are torn down.
class Registry {
 public:
  static Registry& shared() {
    static Registry* registry = new Registry;
    return *registry;
  }

  void add(Category* category) {
    std::lock_guard lock(mutex_);
    categories_.push_back(category);
    update(*category);
  }

  void remove(Category* category) {
    std::lock_guard lock(mutex_);
    std::erase(categories_, category);
  }

  void configure(std::string_view spec) {
    std::lock_guard lock(mutex_);
    settings_ = Settings::parse(spec);
    for (Category* category : categories_) update(*category);
  }

  std::shared_ptr<Sink> sink() {
    std::lock_guard lock(mutex_);
    return sink_;
  }

  void setSink(std::shared_ptr<Sink> sink) {
    std::lock_guard lock(mutex_);
    sink_ = sink ? std::move(sink) : defaultSink_;
  }

 private:
  Registry();

  void update(Category& category) {
    category.enabledMask_.store(settings_.maskFor(category.name()), std::memory_order_relaxed);
  }

  std::mutex mutex_;
  std::vector<Category*> categories_;
  Settings settings_;
  std::shared_ptr<Sink> defaultSink_;
  std::shared_ptr<Sink> sink_;
};

namespace {

int journalPriority(Level level) {
  switch (level) {
    case Level::Error:
      return LOG_ERR;
    case Level::Default:
      return LOG_NOTICE;
    case Level::Info:
      return LOG_INFO;
    case Level::Debug:
      return LOG_DEBUG;
  }
  return LOG_NOTICE;
}

// Whether fd 2 is the stream that systemd named in JOURNAL_STREAM ("<device>:<inode>").
bool standardErrorIsJournal() {
  const char* stream = std::getenv("JOURNAL_STREAM");
  if (stream == nullptr) return false;
  std::string_view text(stream);
  size_t colon = text.find(':');
  if (colon == std::string_view::npos) return false;
  unsigned long long device = 0, inode = 0;
  auto d = std::from_chars(text.data(), text.data() + colon, device);
  auto i = std::from_chars(text.data() + colon + 1, text.data() + text.size(), inode);
  if (d.ec != std::errc() || d.ptr != text.data() + colon || i.ec != std::errc() ||
      i.ptr != text.data() + text.size()) {
    return false;
  }
  struct stat st {};
  if (fstat(STDERR_FILENO, &st) != 0) return false;
  return st.st_dev == device && st.st_ino == inode;
}

void writeAll(int fd, std::string_view bytes) {
  // One write per line keeps lines of different threads apart; the loop only matters for a
  // pipe that takes a partial write.
  while (!bytes.empty()) {
    ssize_t n = ::write(fd, bytes.data(), bytes.size());
    if (n < 0) {
      if (errno == EINTR) continue;
      return;
    }
    bytes.remove_prefix(static_cast<size_t>(n));
  }
}

// The process id, asked of the kernel once per process rather than once per line.
std::atomic<int> gProcessId{0};

int processId() {
  int pid = gProcessId.load(std::memory_order_relaxed);
  if (pid == 0) {
    static std::once_flag atFork;
    std::call_once(atFork, [] {
      pthread_atfork(nullptr, nullptr, [] { gProcessId.store(0, std::memory_order_relaxed); });
    });
    pid = ::getpid();
    gProcessId.store(pid, std::memory_order_relaxed);
  }
  return pid;
}

// Lines of standard error waiting to be written together (bufferLines). One writer thread
// writes them every delay while lines come, and sleeps once a second has passed without a new
// line: a line wakes it only after such a quiet spell, never one line at a time.
class LineBuffer {
 public:
  static LineBuffer& shared() {
    // Never destroyed: lines may still come from other threads while the process exits.
    static LineBuffer* buffer = new LineBuffer;
    return *buffer;
  }

  bool enabled() const { return enabled_.load(std::memory_order_acquire); }

  void start(std::chrono::milliseconds delay) {
    std::lock_guard lock(mutex_);
    delay_ = std::max(delay, std::chrono::milliseconds(1));
    if (enabled_.exchange(true, std::memory_order_acq_rel)) return;
    std::thread([this] { run(); }).detach();
    std::atexit([] { LineBuffer::shared().flush(); });
  }

  void add(const std::string& line, Level level) {
    const bool now = level == Level::Error;
    std::lock_guard lock(mutex_);
    pending_ += line;
    if (level == Level::Info || level == Level::Debug) diagnostic_ = true;
    lastLine_ = std::chrono::steady_clock::now();
    if (now || pending_.size() >= kMaxPending) {
      writeLocked();
    } else if (sleeping_) {
      sleeping_ = false;
      wake_.notify_one();
    }
  }

  void flush() {
    std::lock_guard lock(mutex_);
    writeLocked();
  }

  void flushDiagnostics() {
    std::lock_guard lock(mutex_);
    if (diagnostic_) writeLocked();
  }

  void flushFromSignal() {
    // The interrupted thread may hold the lines; they are then lost rather than the process
    // hung.
    if (!mutex_.try_lock()) return;
    writeLocked();
    mutex_.unlock();
  }

 private:
  static constexpr size_t kMaxPending = 64 * 1024;

  // Written under mutex_, so that batches never overtake one another.
  void writeLocked() {
    diagnostic_ = false;
    if (pending_.empty()) return;
    writeAll(STDERR_FILENO, pending_);
    pending_.clear();
  }

  void run() {
    std::unique_lock lock(mutex_);
    for (;;) {
      // Lines written by flush() count as lines: the writer stays awake while they come.
      if (pending_.empty() && std::chrono::steady_clock::now() - lastLine_ >= kQuietBeforeSleep) {
        sleeping_ = true;
        wake_.wait(lock, [this] { return !sleeping_; });
      }
      wake_.wait_for(lock, delay_);
      writeLocked();
    }
  }

  static constexpr std::chrono::seconds kQuietBeforeSleep{1};

  std::atomic<bool> enabled_{false};
  std::mutex mutex_;
  std::condition_variable wake_;
  std::chrono::milliseconds delay_{10};
  bool sleeping_ = false;
  std::chrono::steady_clock::time_point lastLine_;
  std::string pending_;
  bool diagnostic_ = false;  // an info or debug line is among pending_
};

class StandardErrorSink : public Sink {
 public:
  void write(const Record& record) override {
    std::string line = formatLine(record, std::chrono::system_clock::now(),
                                  program_invocation_short_name, processId());
    LineBuffer& buffer = LineBuffer::shared();
    if (buffer.enabled()) {
      buffer.add(line, record.level);
    } else {
      writeAll(STDERR_FILENO, line);
    }
  }
  void flush() override {
    if (LineBuffer::shared().enabled()) LineBuffer::shared().flush();
  }
};

class JournalSink : public Sink {
 public:
  // Strings are passed with an explicit length: messages are not NUL-terminated views.
  void write(const Record& record) override {
    int r;
    auto message = static_cast<int>(std::min<size_t>(record.message.size(), INT32_MAX));
    if (record.subsystem.empty()) {
      r = sd_journal_send("MESSAGE=%.*s", message, record.message.data(), "PRIORITY=%d",
                          journalPriority(record.level), "LEVEL=%.*s",
                          static_cast<int>(levelName(record.level).size()),
                          levelName(record.level).data(), "SYSLOG_IDENTIFIER=%s",
                          program_invocation_short_name, nullptr);
    } else {
      r = sd_journal_send(
          "MESSAGE=%.*s", message, record.message.data(), "PRIORITY=%d",
          journalPriority(record.level), "SUBSYSTEM=%.*s",
          static_cast<int>(record.subsystem.size()), record.subsystem.data(), "CATEGORY=%.*s",
          static_cast<int>(record.category.size()), record.category.data(), "LEVEL=%.*s",
          static_cast<int>(levelName(record.level).size()), levelName(record.level).data(),
          "SYSLOG_IDENTIFIER=%s", program_invocation_short_name, nullptr);
    }
    if (r < 0) fallback_.write(record);
  }
  void flush() override { fallback_.flush(); }

 private:
  StandardErrorSink fallback_;
};

// --- formatMessage ---------------------------------------------------------------------------

struct Spec {
  bool leftAlign = false;
  bool zeroPad = false;
  bool plus = false;
  bool space = false;
  bool alternate = false;
  std::optional<size_t> width;
  std::optional<size_t> precision;
  int lengthBits = 32;  // of the C type the length modifier names
  char conversion = 0;
};

// Bounds what a hostile or mistaken width can make us allocate.
constexpr size_t kMaxWidth = 4096;

class Arguments {
 public:
  explicit Arguments(std::span<const Arg> args) : args_(args) {}
  const Arg* next() { return index_ < args_.size() ? &args_[index_++] : nullptr; }

 private:
  std::span<const Arg> args_;
  size_t index_ = 0;
};

std::optional<int64_t> asInteger(const Arg* arg) {
  if (arg == nullptr) return std::nullopt;
  if (auto* s = std::get_if<int64_t>(&arg->storage())) return *s;
  if (auto* u = std::get_if<uint64_t>(&arg->storage())) return static_cast<int64_t>(*u);
  return std::nullopt;
}

std::string_view asText(const Arg& arg) {
  if (auto* v = std::get_if<std::string_view>(&arg.storage())) return *v;
  if (auto* s = std::get_if<std::string>(&arg.storage())) return *s;
  return {};
}

bool isText(const Arg& arg) {
  return std::holds_alternative<std::string_view>(arg.storage()) ||
         std::holds_alternative<std::string>(arg.storage());
}

// A signed value printed by an unsigned conversion wraps at the width of its C type.
uint64_t wrapUnsigned(int64_t value, int bits) {
  auto u = static_cast<uint64_t>(value);
  return bits >= 64 ? u : u & ((uint64_t{1} << bits) - 1);
}

std::string renderInteger(const Spec& spec, const Arg& arg) {
  const auto& storage = arg.storage();
  bool negative = false;
  uint64_t magnitude = 0;
  if (auto* s = std::get_if<int64_t>(&storage)) {
    bool isSigned = spec.conversion == 'd' || spec.conversion == 'i';
    if (*s < 0 && isSigned) {
      negative = true;
      magnitude = uint64_t{0} - static_cast<uint64_t>(*s);
    } else {
      magnitude = *s < 0 ? wrapUnsigned(*s, spec.lengthBits) : static_cast<uint64_t>(*s);
    }
  } else {
    magnitude = std::get<uint64_t>(storage);
  }
  std::string digits;
  switch (spec.conversion) {
    case 'x':
      digits = fmt::format("{:x}", magnitude);
      break;
    case 'X':
      digits = fmt::format("{:X}", magnitude);
      break;
    case 'o':
      digits = fmt::format("{:o}", magnitude);
      break;
    default:
      digits = fmt::format("{}", magnitude);
      break;
  }
  if (spec.precision && digits.size() < std::min(*spec.precision, kMaxWidth)) {
    digits.insert(0, std::min(*spec.precision, kMaxWidth) - digits.size(), '0');
  }
  std::string prefix;
  if (negative) {
    prefix = "-";
  } else if ((spec.conversion == 'd' || spec.conversion == 'i') && spec.plus) {
    prefix = "+";
  } else if ((spec.conversion == 'd' || spec.conversion == 'i') && spec.space) {
    prefix = " ";
  }
  if (spec.alternate && magnitude != 0) {
    if (spec.conversion == 'x') prefix += "0x";
    if (spec.conversion == 'X') prefix += "0X";
    if (spec.conversion == 'o') prefix += "0";
  }
  if (spec.zeroPad && !spec.leftAlign && !spec.precision && spec.width) {
    size_t width = std::min(*spec.width, kMaxWidth);
    if (prefix.size() + digits.size() < width) {
      digits.insert(0, width - prefix.size() - digits.size(), '0');
    }
  }
  return prefix + digits;
}

std::string renderDouble(const Spec& spec, double value) {
  int precision = static_cast<int>(std::min<size_t>(spec.precision.value_or(6), 64));
  std::string sign = spec.plus ? "+" : (spec.space ? " " : "");
  switch (spec.conversion) {
    case 'e':
      return fmt::format("{}", value < 0 ? "" : sign) + fmt::format("{:.{}e}", value, precision);
    case 'E':
      return fmt::format("{}", value < 0 ? "" : sign) + fmt::format("{:.{}E}", value, precision);
    case 'g':
      return fmt::format("{}", value < 0 ? "" : sign) +
             fmt::format("{:.{}g}", value, std::max(precision, 1));
    case 'G':
      return fmt::format("{}", value < 0 ? "" : sign) +
             fmt::format("{:.{}G}", value, std::max(precision, 1));
    default:
      return fmt::format("{}", value < 0 ? "" : sign) + fmt::format("{:.{}f}", value, precision);
  }
}

// Any argument as readable text, whatever conversion asked for it.
std::string renderPlain(const Arg& arg) {
  return std::visit([](const auto& v) { return fmt::format("{}", v); }, arg.storage());
}

std::string render(const Spec& spec, const Arg* arg) {
  if (arg == nullptr) return "(null)";
  const auto& storage = arg->storage();
  switch (spec.conversion) {
    case 'd':
    case 'i':
    case 'u':
    case 'x':
    case 'X':
    case 'o':
      if (isText(*arg)) return std::string(asText(*arg));
      if (auto* d = std::get_if<double>(&storage)) return renderDouble({.conversion = 'g'}, *d);
      return renderInteger(spec, *arg);
    case 'c':
      if (auto n = asInteger(arg)) return std::string(1, static_cast<char>(*n));
      return renderPlain(*arg);
    case 'f':
    case 'F':
    case 'e':
    case 'E':
    case 'g':
    case 'G':
      if (auto* d = std::get_if<double>(&storage)) return renderDouble(spec, *d);
      if (auto* s = std::get_if<int64_t>(&storage)) return renderDouble(spec, double(*s));
      if (auto* u = std::get_if<uint64_t>(&storage)) return renderDouble(spec, double(*u));
      return renderPlain(*arg);
    case 'p':
      if (auto n = asInteger(arg)) return fmt::format("0x{:x}", static_cast<uint64_t>(*n));
      return renderPlain(*arg);
    case 's': {
      std::string text = renderPlain(*arg);
      if (spec.precision && isText(*arg) && text.size() > *spec.precision) {
        text.resize(*spec.precision);
      }
      return text;
    }
    default:  // '@', 'P' (a Uuid already holds its text)
      return renderPlain(*arg);
  }
}

bool isDigit(char c) {
  return c >= '0' && c <= '9';
}

size_t parseNumber(std::string_view format, size_t& i) {
  size_t n = 0;
  while (i < format.size() && isDigit(format[i])) {
    n = std::min<size_t>(n * 10 + size_t(format[i] - '0'), kMaxWidth);
    ++i;
  }
  return n;
}

}  // namespace

std::string_view levelName(Level level) {
  switch (level) {
    case Level::Default:
      return "default";
    case Level::Info:
      return "info";
    case Level::Debug:
      return "debug";
    case Level::Error:
      return "error";
  }
  return "default";
}

std::string formatMessage(std::string_view format, std::span<const Arg> args) {
  std::string out;
  out.reserve(format.size() + 16 * args.size());
  Arguments arguments(args);
  size_t i = 0;
  while (i < format.size()) {
    size_t percent = format.find('%', i);
    if (percent == std::string_view::npos) {
      out.append(format.substr(i));
      break;
    }
    out.append(format.substr(i, percent - i));
    size_t start = percent;
    i = percent + 1;
    if (i < format.size() && format[i] == '%') {
      out.push_back('%');
      ++i;
      continue;
    }
    Spec spec;
    // {public}, {private}, {errno}, {uuid_t}: none changes how the value is written here.
    if (i < format.size() && format[i] == '{') {
      size_t close = format.find('}', i);
      if (close == std::string_view::npos) {
        out.append(format.substr(start));
        break;
      }
      i = close + 1;
    }
    for (; i < format.size(); ++i) {
      char c = format[i];
      if (c == '-') {
        spec.leftAlign = true;
      } else if (c == '0') {
        spec.zeroPad = true;
      } else if (c == '+') {
        spec.plus = true;
      } else if (c == ' ') {
        spec.space = true;
      } else if (c == '#') {
        spec.alternate = true;
      } else {
        break;
      }
    }
    if (i < format.size() && format[i] == '*') {
      ++i;
      if (auto n = asInteger(arguments.next())) {
        if (*n < 0) spec.leftAlign = true;
        spec.width = std::min<size_t>(static_cast<size_t>(*n < 0 ? -*n : *n), kMaxWidth);
      }
    } else if (i < format.size() && isDigit(format[i])) {
      spec.width = parseNumber(format, i);
    }
    if (i < format.size() && format[i] == '.') {
      ++i;
      if (i < format.size() && format[i] == '*') {
        ++i;
        auto n = asInteger(arguments.next());
        if (n && *n >= 0) spec.precision = std::min<size_t>(static_cast<size_t>(*n), kMaxWidth);
      } else {
        spec.precision = parseNumber(format, i);
      }
    }
    while (i < format.size()) {
      char c = format[i];
      if (c == 'h') {
        spec.lengthBits = spec.lengthBits == 16 ? 8 : 16;
      } else if (c == 'l' || c == 'j' || c == 'z' || c == 't' || c == 'q' || c == 'L') {
        spec.lengthBits = 64;
      } else {
        break;
      }
      ++i;
    }
    if (i >= format.size()) {
      out.append(format.substr(start));
      break;
    }
    spec.conversion = format[i++];
    static constexpr std::string_view kConversions = "diuxXocfFeEgGps@P";
    if (kConversions.find(spec.conversion) == std::string_view::npos) {
      // Not a conversion we know: keep the text as written and leave the arguments alone.
      out.append(format.substr(start, i - start));
      continue;
    }
    std::string text = render(spec, arguments.next());
    if (spec.width && text.size() < *spec.width) {
      size_t pad = *spec.width - text.size();
      if (spec.leftAlign) {
        text.append(pad, ' ');
      } else {
        text.insert(0, pad, ' ');
      }
    }
    out.append(text);
  }
  return out;
}

std::string formatLine(const Record& record, std::chrono::system_clock::time_point when,
                       std::string_view program, int pid) {
  using namespace std::chrono;
  auto sinceEpoch = when.time_since_epoch();
  auto secs = floor<seconds>(sinceEpoch);
  auto millis = duration_cast<milliseconds>(sinceEpoch - secs).count();
  // Lines come many to a second: the date part is worked out once per second and thread.
  thread_local int64_t stampSecond = std::numeric_limits<int64_t>::min();
  thread_local std::string stamp;
  if (secs.count() != stampSecond) {
    time_t t = static_cast<time_t>(secs.count());
    struct tm tm {};
    gmtime_r(&t, &tm);
    char text[64];
    stamp.assign(text, strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%S", &tm));
    stampSecond = secs.count();
  }
  const std::string_view level = levelName(record.level);
  std::string line;
  line.reserve(stamp.size() + program.size() + level.size() + record.subsystem.size() +
               record.category.size() + record.message.size() + 32);
  line += stamp;
  char number[24];
  number[0] = '.';
  number[1] = static_cast<char>('0' + millis / 100);
  number[2] = static_cast<char>('0' + millis / 10 % 10);
  number[3] = static_cast<char>('0' + millis % 10);
  line.append(number, 4);
  line += "Z ";
  line += program;
  line += '[';
  line.append(number, std::to_chars(number, number + sizeof number, pid).ptr);
  line += ']';
  if (record.subsystem.empty()) {
    line += ": ";
  } else {
    line += ' ';
    line += level;
    line += ' ';
    line += record.subsystem;
    line += ':';
    line += record.category;
    line += ": ";
  }
  line += record.message;
  line += '\n';
  return line;
}

Registry::Registry() {
  const char* spec = std::getenv("EKORA_LOG");
  settings_ = Settings::parse(spec ? spec : "default");
  if (standardErrorIsJournal()) {
    defaultSink_ = std::make_shared<JournalSink>();
  } else {
    defaultSink_ = std::make_shared<StandardErrorSink>();
  }
  sink_ = defaultSink_;
}

void setSink(std::shared_ptr<Sink> sink) {
  Registry::shared().setSink(std::move(sink));
}

void bufferLines(std::chrono::milliseconds delay) {
  LineBuffer::shared().start(delay);
}

void flush() {
  if (auto sink = Registry::shared().sink()) sink->flush();
}

void flushDiagnostics() {
  if (LineBuffer::shared().enabled()) LineBuffer::shared().flushDiagnostics();
}

void flushFromSignal() {
  if (LineBuffer::shared().enabled()) LineBuffer::shared().flushFromSignal();
}

void configure(std::string_view levels) {
  Registry::shared().configure(levels);
}

Category::Category(std::string subsystem, std::string name)
    : subsystem_(std::move(subsystem)), name_(std::move(name)) {
  Registry::shared().add(this);
}

Category::Category(const Category& other) : subsystem_(other.subsystem_), name_(other.name_) {
  Registry::shared().add(this);
}

Category::~Category() {
  Registry::shared().remove(this);
}

bool Throttle::admit(uint64_t* suppressed, Clock::time_point now) {
  int64_t at = now.time_since_epoch().count();
  int64_t allowed = nextAllowed_.load(std::memory_order_relaxed);
  while (at >= allowed) {
    if (nextAllowed_.compare_exchange_weak(allowed, at + interval_.count(),
                                           std::memory_order_relaxed)) {
      *suppressed = suppressed_.exchange(0, std::memory_order_relaxed);
      return true;
    }
  }
  suppressed_.fetch_add(1, std::memory_order_relaxed);
  return false;
}

void Category::write(Level level, std::string_view format, std::span<const Arg> args,
                     uint64_t suppressed) const {
  std::string message = formatMessage(format, args);
  if (suppressed > 0) message += fmt::format(" ({} similar messages suppressed)", suppressed);
  Record record{level, subsystem_, name_, message};
  if (auto sink = Registry::shared().sink()) sink->write(record);
}

namespace {
const Category& made(std::string_view name) {
  // Never destroyed, like the registry, so logging stays possible during exit.
  return *new Category(std::string(kSubsystem), std::string(name));
}
}  // namespace

const Category& ops() {
  static const Category& category = made("ops");
  return category;
}
const Category& traffic() {
  static const Category& category = made("traffic");
  return category;
}
const Category& extension() {
  static const Category& category = made("extension");
  return category;
}
const Category& vr() {
  static const Category& category = made("vr");
  return category;
}
const Category& sandbox() {
  static const Category& category = made("sandbox");
  return category;
}
const Category& process() {
  static const Category& category = *new Category(std::string(), std::string());
  return category;
}

}  // namespace ek::log
