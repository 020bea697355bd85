#include "platform/log/Log.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <sys/wait.h>

#include <atomic>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <mutex>
#include <optional>
#include <thread>
#include <vector>

namespace ek::log {
namespace {

struct CapturedRecord {
  Level level;
  std::string subsystem;
  std::string category;
  std::string message;
};

class CapturingSink : public Sink {
 public:
  void write(const Record& record) override {
    std::lock_guard lock(mutex_);
    records_.push_back({record.level, std::string(record.subsystem), std::string(record.category),
                        std::string(record.message)});
  }
  std::vector<CapturedRecord> records() {
    std::lock_guard lock(mutex_);
    return records_;
  }

 private:
  std::mutex mutex_;
  std::vector<CapturedRecord> records_;
};

class LogTest : public ::testing::Test {
 protected:
  void SetUp() override {
    configure("default");
    setSink(sink_);
  }
  void TearDown() override {
    setSink(nullptr);
    configure("default");
  }
  std::shared_ptr<CapturingSink> sink_ = std::make_shared<CapturingSink>();
};

// Counts how often it is asked for its description, i.e. whether a message was formatted.
struct Counted {
  std::atomic<int>* calls;
  std::string description() const {
    ++*calls;
    return "counted";
  }
};

struct FormatCase {
  const char* format;
  std::vector<Arg> args;
  std::string expected;
};

TEST(FormatMessage, RendersTheDaemonsSpecifiers) {
  Uuid uuid = *Uuid::parse("e621e1f8-c36c-495a-93fc-0c247a3e6e5f");
  Dictionary dict{{"a", Value(1)}};
  const std::string owned = "owned";
  int negative = -1;
  // Arg keeps views of strings it is given, so the error must outlive the table.
  const EkError error = EkError::posix(2, "No such file");
  const std::vector<FormatCase> cases = {
      {"plain text", {}, "plain text"},
      {"client %d requested %s", {4243, "find"}, "client 4243 requested find"},
      {"%i and %u", {-7, 7u}, "-7 and 7"},
      {"%x %X %lx", {255, 255, uint64_t{0xdeadbeef}}, "ff FF deadbeef"},
      {"%llu %ld %lu",
       {uint64_t{18446744073709551615u}, int64_t{-5}, 5ul},
       "18446744073709551615 -5 5"},
      {"%u", {negative}, "4294967295"},
      {"%lu", {negative}, "18446744073709551615"},
      {"%x", {negative}, "ffffffff"},
      {"%@", {Value(dict)}, Value(dict).description()},
      {"%@", {Value("text")}, Value("text").description()},
      {"%s", {owned}, "owned"},
      {"%s", {std::string_view("view")}, "view"},
      {"%s", {true}, "true"},
      {"%p", {reinterpret_cast<const void*>(0x1234)}, "0x1234"},
      {"%f", {1.5}, "1.500000"},
      {"%.2f", {2.0 / 3.0}, "0.67"},
      {"100%%", {}, "100%"},
      {"%{public}@ and %{private}s", {"pub", "priv"}, "pub and priv"},
      {"failed: %{errno}d", {2}, "failed: 2"},
      {"uuid %{uuid_t}.16P", {uuid}, "uuid E621E1F8-C36C-495A-93FC-0C247A3E6E5F"},
      {"[%5d]", {42}, "[   42]"},
      {"[%-5d]", {42}, "[42   ]"},
      {"[%05d]", {-42}, "[-0042]"},
      {"[%8s]", {"ab"}, "[      ab]"},
      {"[%.3s]", {"abcdef"}, "[abc]"},
      {"[%*d]", {4, 7}, "[   7]"},
      {"%#x", {255}, "0xff"},
      {"%zu items", {size_t{3}}, "3 items"},
      {"%hhu", {negative}, "255"},
      {"%d", {"not a number"}, "not a number"},
      {"%s", {12}, "12"},
      {"%f", {"text"}, "text"},
      {"%d", {2.5}, "2.5"},
      {"%f", {3}, "3.000000"},
      {"%@", {int64_t{-3}}, "-3"},
      {"%d and %s", {1}, "1 and (null)"},
      {"%s", {}, "(null)"},
      {"only %d", {1, 2, 3}, "only 1"},
      {"trailing %", {}, "trailing %"},
      {"unknown %k stays", {1}, "unknown %k stays"},
      {"open %{public", {1}, "open %{public"},
      {"error %@", {error}, "error No such file"},
      {"%c", {65}, "A"},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(formatMessage(c.format, c.args), c.expected) << c.format;
  }
}

TEST(FormatMessage, HugeWidthIsBounded) {
  const Arg args[] = {Arg(1)};
  std::string out = formatMessage("%999999999999d", args);
  EXPECT_LE(out.size(), 8192u);
  EXPECT_EQ(out.back(), '1');
}

TEST(FormatMessage, NullCStringIsNull) {
  const char* none = nullptr;
  const Arg args[] = {Arg(none)};
  EXPECT_EQ(formatMessage("%s", args), "(null)");
}

TEST(LevelName, NamesEveryLevel) {
  EXPECT_EQ(levelName(Level::Default), "default");
  EXPECT_EQ(levelName(Level::Info), "info");
  EXPECT_EQ(levelName(Level::Debug), "debug");
  EXPECT_EQ(levelName(Level::Error), "error");
}

TEST_F(LogTest, DefaultEnablesDefaultAndErrorOnly) {
  EXPECT_TRUE(ops().enabled(Level::Default));
  EXPECT_TRUE(ops().enabled(Level::Error));
  EXPECT_FALSE(ops().enabled(Level::Info));
  EXPECT_FALSE(ops().enabled(Level::Debug));
}

TEST_F(LogTest, LevelNamesEnableThemselvesAndLessVerboseLevels) {
  struct Case {
    const char* spec;
    bool defaultOn, infoOn, debugOn, errorOn;
  };
  const Case cases[] = {
      {"debug", true, true, true, true},     {"info", true, true, false, true},
      {"default", true, false, false, true}, {"error", false, false, false, true},
      {"DEBUG", true, true, true, true},     {"nonsense", true, false, false, true},
  };
  for (const auto& c : cases) {
    configure(c.spec);
    EXPECT_EQ(vr().enabled(Level::Default), c.defaultOn) << c.spec;
    EXPECT_EQ(vr().enabled(Level::Info), c.infoOn) << c.spec;
    EXPECT_EQ(vr().enabled(Level::Debug), c.debugOn) << c.spec;
    EXPECT_EQ(vr().enabled(Level::Error), c.errorOn) << c.spec;
  }
}

TEST_F(LogTest, PerCategoryListSetsEachCategory) {
  Category later(std::string(kSubsystem), "later");
  configure("ops:debug, vr:info,later:error");
  EXPECT_TRUE(ops().enabled(Level::Debug));
  EXPECT_TRUE(vr().enabled(Level::Info));
  EXPECT_FALSE(vr().enabled(Level::Debug));
  EXPECT_FALSE(traffic().enabled(Level::Info));
  EXPECT_TRUE(traffic().enabled(Level::Default));
  EXPECT_FALSE(later.enabled(Level::Default));
  EXPECT_TRUE(later.enabled(Level::Error));
}

TEST_F(LogTest, BareLevelInListAppliesToUnlistedCategories) {
  configure("info,ops:error");
  EXPECT_TRUE(sandbox().enabled(Level::Info));
  EXPECT_FALSE(ops().enabled(Level::Default));
}

TEST_F(LogTest, CategoryMadeAfterConfigureFollowsIt) {
  configure("extra:debug");
  Category extra(std::string(kSubsystem), "extra");
  Category copy(extra);
  EXPECT_TRUE(extra.enabled(Level::Debug));
  EXPECT_TRUE(copy.enabled(Level::Debug));
  configure("default");
  EXPECT_FALSE(copy.enabled(Level::Debug));
}

TEST_F(LogTest, DisabledMessageIsNeitherFormattedNorWritten) {
  std::atomic<int> calls{0};
  ops().debug("value %@", Counted{&calls});
  EXPECT_EQ(calls.load(), 0);
  EXPECT_TRUE(sink_->records().empty());

  configure("ops:debug");
  ops().debug("value %@", Counted{&calls});
  EXPECT_EQ(calls.load(), 1);
  ASSERT_EQ(sink_->records().size(), 1u);
  EXPECT_EQ(sink_->records()[0].message, "value counted");
}

TEST_F(LogTest, SinkReceivesLevelSubsystemCategoryAndMessage) {
  configure("debug");
  ops().debug("client %d requested %{public}s", 4243, "find");
  vr().info("info");
  extension().defaultLevel("default");
  sandbox().error("error");
  process().error("refused request from pid=%d", 12);
  auto records = sink_->records();
  ASSERT_EQ(records.size(), 5u);
  EXPECT_EQ(records[0].level, Level::Debug);
  EXPECT_EQ(records[0].subsystem, "com.corvane.Ekora");
  EXPECT_EQ(records[0].category, "ops");
  EXPECT_EQ(records[0].message, "client 4243 requested find");
  EXPECT_EQ(records[1].level, Level::Info);
  EXPECT_EQ(records[1].category, "vr");
  EXPECT_EQ(records[2].level, Level::Default);
  EXPECT_EQ(records[2].category, "extension");
  EXPECT_EQ(records[3].level, Level::Error);
  EXPECT_EQ(records[3].category, "sandbox");
  EXPECT_EQ(records[4].subsystem, "");
  EXPECT_EQ(records[4].message, "refused request from pid=12");
}

// One line a second of a kind; the next line written counts those held back.
TEST(Throttle, AdmitsOneLineASecondAndCountsTheRest) {
  using std::chrono::milliseconds;
  struct Step {
    int atMs;
    bool admitted;
    uint64_t suppressed;  // when admitted
  };
  const std::vector<Step> steps{
      {0, true, 0},     {10, false, 0},  {999, false, 0},  {1000, true, 2},
      {1500, false, 0}, {5000, true, 1}, {5001, false, 0}, {6001, true, 1},
  };
  Throttle throttle;
  const Throttle::Clock::time_point start{std::chrono::hours(1)};
  for (const Step& step : steps) {
    uint64_t suppressed = 99;
    EXPECT_EQ(throttle.admit(&suppressed, start + milliseconds(step.atMs)), step.admitted)
        << step.atMs;
    if (step.admitted) {
      EXPECT_EQ(suppressed, step.suppressed) << step.atMs;
    }
  }
}

TEST_F(LogTest, CategoriesAreMadeOnce) {
  EXPECT_EQ(&ops(), &ops());
  EXPECT_EQ(&process(), &process());
  EXPECT_NE(&ops(), &vr());
  EXPECT_EQ(traffic().name(), "traffic");
  EXPECT_EQ(traffic().subsystem(), kSubsystem);
}

std::chrono::system_clock::time_point sampleTime() {
  // 2026-11-23T10:04:05.123Z
  return std::chrono::system_clock::time_point(std::chrono::milliseconds(1795428245123));
}

TEST(FormatLine, CategoryLineCarriesLevelSubsystemAndCategory) {
  Record record{Level::Debug, kSubsystem, "ops", "client 4243 requested find"};
  EXPECT_EQ(formatLine(record, sampleTime(), "ekd", 4242),
            "2026-11-23T10:04:05.123Z ekd[4242] debug com.corvane.Ekora:ops: client 4243 "
            "requested find\n");
}

TEST(FormatLine, PlainLogHasNoLevelOrSubsystem) {
  Record record{Level::Error, "", "", "refused request from pid=7"};
  EXPECT_EQ(formatLine(record, sampleTime(), "ekd", 4242),
            "2026-11-23T10:04:05.123Z ekd[4242]: refused request from pid=7\n");
}

TEST(FormatLine, MillisecondsArePadded) {
  Record record{Level::Default, kSubsystem, "vr", "m"};
  auto when = std::chrono::system_clock::time_point(std::chrono::milliseconds(1795428245007));
  EXPECT_EQ(formatLine(record, when, "ekd", 1),
            "2026-11-23T10:04:05.007Z ekd[1] default com.corvane.Ekora:vr: m\n");
}

// Sends fd 2 into a pipe while alive; a reader thread drains it so writers never block.
class StderrCapture {
 public:
  StderrCapture() {
    EXPECT_EQ(pipe2(fds_, O_CLOEXEC), 0);
    saved_ = dup(STDERR_FILENO);
    dup2(fds_[1], STDERR_FILENO);
    close(fds_[1]);
    reader_ = std::thread([this] {
      char buffer[4096];
      ssize_t n;
      while ((n = read(fds_[0], buffer, sizeof buffer)) > 0) text_.append(buffer, size_t(n));
    });
  }
  std::string finish() {
    dup2(saved_, STDERR_FILENO);
    close(saved_);
    reader_.join();
    close(fds_[0]);
    return text_;
  }

 private:
  int fds_[2] = {-1, -1};
  int saved_ = -1;
  std::thread reader_;
  std::string text_;
};

class StderrLogTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (std::getenv("JOURNAL_STREAM") != nullptr)
      GTEST_SKIP() << "standard error may be the journal";
    setSink(nullptr);
    configure("default");
  }
  void TearDown() override { configure("default"); }
};

// Splits a written line into its time stamp, which must have the shape
// "YYYY-MM-DDTHH:MM:SS.mmmZ ", and the rest.
std::optional<std::string> afterTimeStamp(std::string_view line) {
  constexpr std::string_view kShape = "dddd-dd-ddTdd:dd:dd.dddZ ";
  if (line.size() < kShape.size()) return std::nullopt;
  for (size_t i = 0; i < kShape.size(); ++i) {
    bool ok = kShape[i] == 'd' ? (line[i] >= '0' && line[i] <= '9') : line[i] == kShape[i];
    if (!ok) return std::nullopt;
  }
  return std::string(line.substr(kShape.size()));
}

std::vector<std::string> splitLines(const std::string& text) {
  std::vector<std::string> lines;
  size_t start = 0;
  while (start < text.size()) {
    size_t end = text.find('\n', start);
    if (end == std::string::npos) {
      lines.push_back(text.substr(start) + "<no newline>");
      break;
    }
    lines.push_back(text.substr(start, end - start));
    start = end + 1;
  }
  return lines;
}

TEST_F(StderrLogTest, DefaultSinkWritesTheLineFormat) {
  StderrCapture capture;
  ops().error("client %d requested %s", 4243, "find");
  process().defaultLevel("refused request from pid=%d", 99);
  std::string text = capture.finish();
  std::string program = "ek_log_test[" + std::to_string(getpid()) + "]";
  auto lines = splitLines(text);
  ASSERT_EQ(lines.size(), 2u) << text;
  EXPECT_EQ(afterTimeStamp(lines[0]),
            program + " error com.corvane.Ekora:ops: client 4243 requested find")
      << lines[0];
  EXPECT_EQ(afterTimeStamp(lines[1]), program + ": refused request from pid=99") << lines[1];
}

TEST_F(StderrLogTest, LinesOfConcurrentThreadsDoNotInterleave) {
  constexpr int kThreads = 8;
  constexpr int kLines = 200;
  StderrCapture capture;
  {
    std::vector<std::jthread> threads;
    for (int t = 0; t < kThreads; ++t) {
      threads.emplace_back([t] {
        std::string payload(300, char('a' + t));
        for (int i = 0; i < kLines; ++i) ops().error("%d %d %s", t, i, payload);
      });
    }
  }
  std::string prefix =
      "ek_log_test[" + std::to_string(getpid()) + "] error com.corvane.Ekora:ops: ";
  std::vector<int> seen(kThreads, 0);
  for (const std::string& line : splitLines(capture.finish())) {
    auto rest = afterTimeStamp(line);
    ASSERT_TRUE(rest && rest->starts_with(prefix)) << line;
    std::string message = rest->substr(prefix.size());
    int t = message[0] - '0';
    ASSERT_TRUE(t >= 0 && t < kThreads) << line;
    std::string expected =
        std::to_string(t) + " " + std::to_string(seen[t]) + " " + std::string(300, char('a' + t));
    ASSERT_EQ(message, expected);
    ++seen[t];
  }
  for (int t = 0; t < kThreads; ++t) EXPECT_EQ(seen[t], kLines) << t;
}

TEST_F(StderrLogTest, DisabledLevelWritesNothing) {
  StderrCapture capture;
  ops().debug("hidden %d", 1);
  vr().info("hidden");
  EXPECT_EQ(capture.finish(), "");
}

// --- bufferLines: held for the whole process, so each case runs in a child of its own ---

// What a child wrote to its standard error (a pipe), and how it ended. The body answers 0, or
// the number of the check that failed; it may read what has reached the pipe so far.
struct ChildRun {
  std::string written;
  int status = -1;
};

ChildRun inChild(const std::function<int(int pipe)>& body) {
  int fds[2];
  if (pipe2(fds, O_CLOEXEC) != 0) return {};
  fcntl(fds[1], F_SETPIPE_SZ, 1 << 20);  // room for a backlog the child reads itself
  pid_t pid = fork();
  if (pid == 0) {
    dup2(fds[1], STDERR_FILENO);
    close(fds[1]);
    fcntl(fds[0], F_SETFL, O_NONBLOCK);
    std::exit(body(fds[0]));  // through exit: what still waits is written by then
  }
  close(fds[1]);
  // The child reads the same pipe: what is left is read once it has ended.
  int status = 0;
  waitpid(pid, &status, 0);
  ChildRun run;
  run.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  fcntl(fds[0], F_SETFL, O_NONBLOCK);
  char buffer[4096];
  for (ssize_t n; (n = read(fds[0], buffer, sizeof buffer)) > 0;)
    run.written.append(buffer, size_t(n));
  close(fds[0]);
  return run;
}

// What has reached the pipe and not been read yet.
std::string arrived(int pipe) {
  std::string text;
  char buffer[4096];
  for (ssize_t n; (n = read(pipe, buffer, sizeof buffer)) > 0;) text.append(buffer, size_t(n));
  return text;
}

// Whether line shows up in the pipe within five seconds.
bool arrives(int pipe, std::string_view line) {
  std::string text;
  for (int i = 0; i < 500; ++i) {
    text += arrived(pipe);
    if (text.find(line) != std::string::npos) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return false;
}

bool inOrder(const std::string& text, std::initializer_list<std::string_view> parts) {
  size_t at = 0;
  for (std::string_view part : parts) {
    at = text.find(part, at);
    if (at == std::string::npos) return false;
  }
  return true;
}

TEST_F(StderrLogTest, BufferedLinesWaitUntilAnErrorAFlushOrExit) {
  ChildRun run = inChild([](int pipe) {
    bufferLines(std::chrono::hours(1));
    ops().defaultLevel("first");
    if (!arrived(pipe).empty()) return 1;
    ops().error("second");
    if (!inOrder(arrived(pipe), {"default com.corvane.Ekora:ops: first\n",
                                 "error com.corvane.Ekora:ops: second\n"})) {
      return 2;
    }
    process().defaultLevel("third");
    if (!arrived(pipe).empty()) return 3;
    // Before a reply only info and debug lines are written.
    flushDiagnostics();
    if (!arrived(pipe).empty()) return 6;
    configure("info");
    ops().info("diagnosis");
    flushDiagnostics();
    if (!inOrder(arrived(pipe), {"]: third\n", "ops: diagnosis\n"})) return 4;
    configure("default");
    // A backlog is written without waiting for anything.
    for (int i = 0; i < 80; ++i) ops().defaultLevel("%d %s", i, std::string(1000, 'x'));
    std::string backlog = arrived(pipe);
    if (backlog.size() < 64 * 1024 || !inOrder(backlog, {" 0 xxx", " 50 xxx"})) return 5;
    flush();
    arrived(pipe);
    ops().defaultLevel("last, written at exit");
    return 0;
  });
  EXPECT_EQ(run.status, 0);
  EXPECT_NE(run.written.find("ops: last, written at exit\n"), std::string::npos) << run.written;
}

TEST_F(StderrLogTest, BufferedLinesAreWrittenFromASignalHandler) {
  ChildRun run = inChild([](int pipe) {
    bufferLines(std::chrono::hours(1));
    std::signal(SIGUSR1, [](int) { flushFromSignal(); });
    ops().defaultLevel("before the crash");
    if (!arrived(pipe).empty()) return 1;
    std::raise(SIGUSR1);
    if (arrived(pipe).find("ops: before the crash\n") == std::string::npos) return 2;
    return 0;
  });
  EXPECT_EQ(run.status, 0) << run.written;
}

TEST_F(StderrLogTest, BufferedLinesAreWrittenAfterTheDelayEvenAfterAQuietSpell) {
  ChildRun run = inChild([](int pipe) {
    bufferLines(std::chrono::milliseconds(20));
    ops().defaultLevel("soon");
    if (!arrives(pipe, "soon\n")) return 1;
    // Long enough for the writer to stop looking and sleep until the next line.
    std::this_thread::sleep_for(std::chrono::milliseconds(1500));
    ops().defaultLevel("after a quiet spell");
    if (!arrives(pipe, "after a quiet spell\n")) return 2;
    return 0;
  });
  EXPECT_EQ(run.status, 0) << run.written;
}

TEST_F(StderrLogTest, BufferedLinesOfConcurrentThreadsKeepTheirOrder) {
  constexpr int kThreads = 8;
  constexpr int kLines = 300;
  ChildRun run = inChild([](int) {
    bufferLines(std::chrono::milliseconds(5));
    std::vector<std::jthread> threads;
    for (int t = 0; t < kThreads; ++t) {
      threads.emplace_back([t] {
        for (int i = 0; i < kLines; ++i)
          ops().defaultLevel("%d %d %s", t, i, std::string(100, 'y'));
      });
    }
    return 0;
  });
  ASSERT_EQ(run.status, 0);
  std::vector<int> seen(kThreads, 0);
  for (const std::string& line : splitLines(run.written)) {
    auto rest = afterTimeStamp(line);
    ASSERT_TRUE(rest.has_value()) << line;
    size_t colon = rest->find("ops: ");
    ASSERT_NE(colon, std::string::npos) << line;
    int t = -1, i = -1;
    ASSERT_EQ(std::sscanf(rest->c_str() + colon + 5, "%d %d", &t, &i), 2) << line;
    ASSERT_TRUE(t >= 0 && t < kThreads) << line;
    ASSERT_EQ(i, seen[t]) << line;
    ++seen[t];
  }
  for (int t = 0; t < kThreads; ++t) EXPECT_EQ(seen[t], kLines) << t;
}

}  // namespace
}  // namespace ek::log
