#include "platform/log/Log.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <sys/wait.h>

#include <fmt/format.h>

#include <csignal>
#include <cstdlib>
#include <thread>

#include "platform/log/testing/CapturingSink.h"

namespace ek::log {
namespace {

// Standard error, not the journal, even when the tests run under a service manager.
[[maybe_unused]] const bool kNotTheJournal = unsetenv("JOURNAL_STREAM") == 0;

TEST(FormatMessage, RendersTheDaemonsSpecifiers) {
  const Value dict(Dictionary{{"a", Value(1)}});
  int negative = -1;
  const std::string owned = "owned";  // an argument views its text, so the text must outlive it
  const std::tuple<const char*, std::vector<Arg>, std::string> cases[] = {
      {"client %d requested %{public}s", {4243, "find"}, "client 4243 requested find"},
      {"%999999999999d", {1}, std::string(4095, ' ') + "1"},  // a hostile width is bounded
      {"%u %lx %llu",
       {negative, negative, uint64_t{1} << 63},
       "4294967295 ffffffffffffffff 9223372036854775808"},
      {"%@ %{private}s %s", {dict, owned, true}, dict.description() + " owned true"},
      {"failed: %{errno}d, %{uuid_t}.16P",
       {2, *Uuid::parse("e621e1f8-c36c-495a-93fc-0c247a3e6e5f")},
       "failed: 2, E621E1F8-C36C-495A-93FC-0C247A3E6E5F"},
      {"%d %s %f, %s, unknown %k, open %{public",
       {"text", 12, 3},
       "text 12 3.000000, (null), unknown %k, open %{public"},
  };
  for (const auto& [format, args, expected] : cases) {
    EXPECT_EQ(formatMessage(format, args), expected) << format;
  }
}

// Which of default, info, debug and error a category lets through.
std::string enabledLevels(const Category& category) {
  std::string levels;
  for (Level level : {Level::Default, Level::Info, Level::Debug, Level::Error}) {
    if (category.enabled(level)) levels += std::string(levelName(level)) + " ";
  }
  return levels;
}

TEST(Log, LevelsEnableThemselvesAndLessVerboseOnesPerCategory) {
  const std::tuple<const char*, const Category&, const char*> cases[] = {
      {"default", ops(), "default error "},
      {"debug", vr(), "default info debug error "},
      {"ERROR", vr(), "error "},
      {"ops:debug, vr:info,sandbox:error", ops(), "default info debug error "},
      {"ops:debug, vr:info,sandbox:error", vr(), "default info error "},
      {"ops:debug, vr:info,sandbox:error", sandbox(), "error "},
      {"info,ops:error", ops(), "error "},
  };
  for (const auto& [spec, category, levels] : cases) {
    configure(spec);
    EXPECT_EQ(enabledLevels(category), levels) << spec << " " << category.name();
  }
  configure("extra:debug");
  Category extra(std::string(kSubsystem), "extra");
  EXPECT_EQ(enabledLevels(Category(extra)), "default info debug error ");
  // A message below the enabled level is neither formatted nor written.
  struct Counted {
    int* calls;
    std::string description() const { return std::to_string(++*calls); }
  };
  auto sink = std::make_shared<testing::CapturingSink>();
  setSink(sink);
  int calls = 0;
  ops().debug("value %@", Counted{&calls});
  extra.debug("value %@", Counted{&calls});
  setSink(nullptr);
  EXPECT_EQ(calls, 1);
  EXPECT_EQ(sink->lines().size(), 1u);
  EXPECT_TRUE(sink->has(Level::Debug, "extra", "value 1"));
}

// One line a second of a kind; the next line written counts those held back.
TEST(Throttle, AdmitsOneLineASecondAndCountsTheRest) {
  // At a time in ms: whether admitted, and then how many were held back.
  const std::tuple<int, bool, uint64_t> steps[] = {
      {0, true, 0},     {10, false, 0},  {999, false, 0},  {1000, true, 2},
      {1500, false, 0}, {5000, true, 1}, {5001, false, 0}, {6001, true, 1},
  };
  Throttle throttle;
  const Throttle::Clock::time_point start{std::chrono::hours(1)};
  for (const auto& [ms, admitted, held] : steps) {
    uint64_t suppressed = 99;
    EXPECT_EQ(throttle.admit(&suppressed, start + std::chrono::milliseconds(ms)), admitted) << ms;
    EXPECT_EQ(suppressed, admitted ? held : 99) << ms;
  }
}

// What has reached the pipe and not been read yet.
std::string arrived(int pipe) {
  std::string text;
  char buffer[4096];
  for (ssize_t n; (n = read(pipe, buffer, sizeof buffer)) > 0;) text.append(buffer, size_t(n));
  return text;
}

// Whether text ends with the line last and holds the line earlier before it.
bool endsWith(const std::string& text, std::string_view earlier, std::string_view last) {
  return text.find(earlier) < text.size() - last.size() && text.ends_with(last);
}

// Runs in a child whose standard error is a pipe; the child answers 0, or the number of the
// check that failed, and ends through exit, which writes whatever lines still wait.
TEST(StandardError, BufferedLinesKeepTheirOrderAndWaitForAnErrorAFlushASignalOrExit) {
  constexpr int kThreads = 4, kLines = 200;
  int fds[2];
  ASSERT_EQ(pipe2(fds, O_CLOEXEC), 0);
  fcntl(fds[0], F_SETFL, O_NONBLOCK);
  fcntl(fds[1], F_SETPIPE_SZ, 1 << 20);  // room for everything the child writes
  const pid_t child = fork();
  if (child == 0) {
    dup2(fds[1], STDERR_FILENO);
    const int pipe = fds[0];  // read back by the child as it goes
    setSink(nullptr);
    bufferLines(std::chrono::hours(1));
    ops().defaultLevel("first");
    if (!arrived(pipe).empty()) std::exit(1);
    ops().error("second");
    if (!endsWith(arrived(pipe), "ops: first\n", "ops: second\n")) std::exit(2);
    process().defaultLevel("third");
    flushDiagnostics();  // before a reply only info and debug lines are written
    if (!arrived(pipe).empty()) std::exit(3);
    configure("info");
    ops().info("diagnosis");
    flushDiagnostics();
    if (!endsWith(arrived(pipe), "]: third\n", "ops: diagnosis\n")) std::exit(4);
    for (int i = 0; i < 80; ++i) ops().defaultLevel("%d %s", i, std::string(1000, 'x'));
    if (arrived(pipe).size() < 64 * 1024) std::exit(5);  // a backlog is written at once
    flush();
    std::signal(SIGUSR1, [](int) { flushFromSignal(); });
    ops().defaultLevel("before the crash");
    std::raise(SIGUSR1);
    if (!arrived(pipe).ends_with("ops: before the crash\n")) std::exit(6);
    bufferLines(std::chrono::milliseconds(1));
    std::vector<std::jthread> threads;
    for (int t = 0; t < kThreads; ++t) {
      threads.emplace_back([t] {
        for (int i = 0; i < kLines; ++i) ops().defaultLevel("thread %d line %d", t, i);
      });
    }
    threads.clear();
    process().defaultLevel("refused request from pid=%d", 7);
    std::exit(0);
  }
  close(fds[1]);
  int status = -1;
  waitpid(child, &status, 0);
  EXPECT_EQ(status, 0);
  // Whole lines, each thread's in the order written.
  const std::string text = arrived(fds[0]);
  close(fds[0]);
  // The plain process log has neither level nor category.
  EXPECT_TRUE(
      text.ends_with(fmt::format("Z ek_log_test[{}]: refused request from pid=7\n", child)));
  for (int t = 0; t < kThreads; ++t) {
    size_t at = 0;
    for (int i = 0; i < kLines && at != std::string::npos; ++i) {
      at = text.find(
          fmt::format("Z ek_log_test[{}] default com.corvane.Ekora:ops: thread {} line {}\n", child,
                      t, i),
          at);
    }
    EXPECT_NE(at, std::string::npos) << t;
  }
}

}  // namespace
}  // namespace ek::log
