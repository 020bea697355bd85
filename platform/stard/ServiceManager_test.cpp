#include "platform/stard/ServiceManager.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <future>
#include <sstream>
#include <thread>

#include "platform/dmap/Dmap.h"
#include "platform/testing/Files.h"

namespace ek::stard {
namespace {

namespace fs = std::filesystem;

std::string readFile(const std::string& path) {
  std::stringstream text;
  text << std::ifstream(path).rdbuf();
  return text.str();
}

// Field 22 of /proc/<pid>/stat.
uint64_t startTime(pid_t pid) {
  std::string stat = readFile("/proc/" + std::to_string(pid) + "/stat");
  std::istringstream fields(stat.substr(stat.rfind(')') + 2));
  std::string field;
  for (int i = 3; i <= 22; ++i) fields >> field;
  return std::stoull(field);
}

// A child that has exited; reaped unless asked to stay a zombie.
pid_t exitedChild(bool zombie = false) {
  pid_t pid = fork();
  if (pid == 0) _exit(0);
  siginfo_t info{};
  waitid(P_PID, id_t(pid), &info, WEXITED | (zombie ? WNOWAIT : 0));
  return pid;
}

int waitForExit(pid_t pid) {
  int status = 0;
  while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  return status;
}

class FileServiceManagerTest : public ::testing::Test {
 protected:
  std::string declarationFile(pid_t host, const std::string& identifier) const {
    return root_.file("services/" + std::to_string(host) + "/" + identifier + ".dmap");
  }
  int declare(const std::string& identifier, const std::string& program, pid_t host = getpid()) {
    return manager_.addExternalService(host, "/usr/bin/host", identifier, program, {});
  }
  // The answer of removeExternalService, which must come on the given queue.
  int remove(const std::string& identifier) {
    // Shared: the answering thread may still be inside set_value when get() returns.
    auto answered = std::make_shared<std::promise<std::pair<int, bool>>>();
    manager_.removeExternalService(identifier, "1", queue_, [answered, queue = queue_](int code) {
      answered->set_value({code, queue->isCurrent()});
    });
    auto [code, onQueue] = answered->get_future().get();
    EXPECT_TRUE(onQueue) << identifier;
    return code;
  }

  testing::TempDir root_;
  FileServiceManager manager_{root_.path()};
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::make("stard-test");
};

TEST_F(FileServiceManagerTest, DeclarationKeepsWhatItIsGivenAndRefusesWhatItCannotName) {
  const std::string odd = "<dict>]]> a &amp; \"b\"\ttab\nünïcödé 𝄞";
  const Dictionary overlay{{"WyreService", Value(Dictionary{{odd, Value(odd)}})}};
  ASSERT_EQ(manager_.addExternalService(getpid(), odd, "com.example.one", odd, overlay), kSuccess);
  const Value expected(Dictionary{{"host-pid", Value(getpid())},
                                  {"host-path", Value(odd)},
                                  {"program", Value(odd)},
                                  {"overlay", Value(overlay)}});
  EXPECT_EQ(dmap::readFile(declarationFile(getpid(), "com.example.one")).value(), expected);
  EXPECT_EQ(Value(manager_.declaration(getpid(), "com.example.one").value()), expected);
  EXPECT_FALSE(manager_.declaration(getpid(), "com.example.other"));
  EXPECT_EQ(declare(std::string(242, 'y'), "/bin/true"), kSuccess);

  for (const std::string& identifier :
       {std::string(), std::string("."), std::string(".."), std::string("a/b"),
        std::string("nul\0id", 6), std::string(243, 'x')}) {
    EXPECT_EQ(declare(identifier, "/bin/true"), EINVAL) << identifier;
    EXPECT_EQ(remove(identifier), EINVAL) << identifier;
    EXPECT_TRUE(manager_.launch(getpid(), identifier).error().isPosix(EINVAL)) << identifier;
  }
  for (pid_t host : {0, -5}) EXPECT_EQ(declare("com.example.bad", "/bin/true", host), EINVAL);
  // Text the file cannot carry.
  for (const std::string& text : {std::string("nul\0byte", 8), std::string("\xff\xfe")}) {
    EXPECT_EQ(declare("com.example.bad", text), EINVAL);
  }
  EXPECT_FALSE(fs::exists(declarationFile(getpid(), "com.example.bad")));
}

TEST_F(FileServiceManagerTest, DeclarationsOfExitedHostsArePruned) {
  pid_t gone = exitedChild();
  pid_t zombie = exitedChild(true);
  ASSERT_EQ(declare("com.example.a", "/bin/true", gone), kSuccess);
  ASSERT_TRUE(testing::writeFile(declarationFile(zombie, "com.example.a"), "x"));
  ASSERT_EQ(declare("com.example.a", "/bin/true"), kSuccess);  // writing prunes
  EXPECT_FALSE(fs::exists(root_.file("services/" + std::to_string(gone))));
  manager_.pruneDeclarations();
  EXPECT_FALSE(fs::exists(root_.file("services/" + std::to_string(zombie))));
  EXPECT_TRUE(fs::exists(declarationFile(getpid(), "com.example.a")));
  waitForExit(zombie);
}

TEST_F(FileServiceManagerTest, RemovalEndsEveryInstanceOfEveryHostAndItsDeclarations) {
  pid_t otherHost = fork();
  if (otherHost == 0) {
    pause();
    _exit(0);
  }
  ASSERT_EQ(declare("com.example.multi", "/bin/sleep"), kSuccess);
  ASSERT_EQ(declare("com.example.multi", "/bin/sleep", otherHost), kSuccess);
  // An instance must not inherit a blocked SIGTERM, or removal could not end it.
  sigset_t term, previous;
  sigemptyset(&term);
  sigaddset(&term, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &term, &previous);
  auto first = manager_.launch(getpid(), "com.example.multi", {"30"});
  auto second = manager_.launch(otherHost, "com.example.multi", {"30"});
  pthread_sigmask(SIG_SETMASK, &previous, nullptr);
  ASSERT_TRUE(first.ok() && second.ok());

  auto running = manager_.instances({"com.example.multi", "com.example.none"});
  ASSERT_EQ(running.size(), 2u);
  for (const Instance& instance : running) {
    EXPECT_EQ(instance.hostPid, instance.pid == *first ? getpid() : otherHost);
  }
  EXPECT_EQ(remove("com.example.multi"), kSuccess);
  EXPECT_EQ(WTERMSIG(waitForExit(*first)), SIGTERM);
  EXPECT_EQ(WTERMSIG(waitForExit(*second)), SIGTERM);
  EXPECT_TRUE(manager_.instances({"com.example.multi"}).empty());
  EXPECT_FALSE(fs::exists(declarationFile(otherHost, "com.example.multi")));
  EXPECT_TRUE(manager_.launch(getpid(), "com.example.multi").error().isPosix(ENOENT));
  EXPECT_EQ(remove("com.example.multi"), kNoSuchProcess);
  kill(otherHost, SIGKILL);
  waitForExit(otherHost);
}

TEST_F(FileServiceManagerTest, InstanceGetsTheOverlayEnvironmentOrFailsRecordingNothing) {
  setenv("EK_STARD_INHERITED", "from-daemon", 1);
  setenv("EK_STARD_OVERRIDDEN", "from-daemon", 1);
  Dictionary variables{{"EK_STARD_OVERRIDDEN", Value("from overlay $HOME")}, {"NUMBER", Value(5)}};
  ASSERT_EQ(manager_.addExternalService(
                getpid(), "/h", "com.example.env", "/bin/sh",
                {{"WyreService", Value(Dictionary{{"EnvironmentVariables", Value(variables)}})}}),
            kSuccess);
  const std::string output = root_.file("env.out");
  auto launched = manager_.launch(getpid(), "com.example.env",
                                  {"-c",
                                   "printf '%s|%s|%s' \"${NUMBER-unset}\" \"$EK_STARD_INHERITED\" "
                                   "\"$EK_STARD_OVERRIDDEN\" > \"$0\"",
                                   output});
  ASSERT_TRUE(launched.ok()) << launched.error().message;
  EXPECT_EQ(waitForExit(*launched), 0);
  EXPECT_EQ(readFile(output), "unset|from-daemon|from overlay $HOME");

  ASSERT_EQ(declare("com.example.missing", root_.file("no-such-program")), kSuccess);
  for (const char* identifier : {"com.example.missing", "com.example.undeclared"}) {
    EXPECT_TRUE(manager_.launch(getpid(), identifier).error().isPosix(ENOENT)) << identifier;
    EXPECT_TRUE(manager_.instances({identifier}).empty()) << identifier;
  }
}

std::atomic<int> termsReceived{0};

TEST_F(FileServiceManagerTest, StaleOrGarbageEntriesArePrunedAndNeverSignalled) {
  struct sigaction counting {
  }, previous{};
  counting.sa_handler = [](int) { termsReceived.fetch_add(1); };
  sigaction(SIGTERM, &counting, &previous);
  const std::string directory = root_.file("instances/com.example.stale/");
  auto entry = [&](pid_t pid, uint64_t start) {
    return dmap::write(Value(Dictionary{{"pid", Value(pid)},
                                        {"start-time", Value(start)},
                                        {"host-pid", Value(getpid())},
                                        {"program", Value("/bin/sleep")}}))
        .value();
  };
  pid_t gone = exitedChild();
  pid_t zombie = exitedChild(true);
  const std::vector<std::pair<std::string, std::string>> stale = {
      {std::to_string(getpid()), entry(getpid(), startTime(getpid()) + 1)},  // a recycled pid
      {std::to_string(gone), entry(gone, startTime(getpid()))},
      {std::to_string(zombie), entry(zombie, startTime(zombie))},
      {"not-a-pid", entry(getpid(), startTime(getpid()))},
      {"101", "not dmap at all"},
      {"102", dmap::write(Value(Array{})).value()},
      {"103", entry(999, 1)},
      {"104", std::string(65 * 1024, ' ')},
  };
  for (const auto& [name, bytes] : stale) testing::writeFile(directory + name + ".dmap", bytes);
  testing::writeFile(directory + ".104.dmap.inprogress", "partial");

  EXPECT_EQ(remove("com.example.stale"), kNoSuchProcess);
  for (const auto& [name, bytes] : stale) EXPECT_FALSE(fs::exists(directory + name + ".dmap"));
  EXPECT_TRUE(fs::exists(directory + ".104.dmap.inprogress"));  // a write in progress
  EXPECT_EQ(termsReceived.load(), 0);
  sigaction(SIGTERM, &previous, nullptr);
  waitForExit(zombie);

  testing::writeFile(root_.file("instances/com.example.self/") + std::to_string(getpid()) + ".dmap",
                     entry(getpid(), startTime(getpid())));
  ASSERT_EQ(manager_.instances({"com.example.self"}).size(), 1u);
}

TEST_F(FileServiceManagerTest, ConcurrentLaunchesAndRemovalsEachEndTheirInstance) {
  std::vector<std::thread> threads;
  for (int t = 0; t < 3; ++t) {
    threads.emplace_back([&, t] {
      const std::string identifier = "com.example.parallel" + std::to_string(t);
      for (int round = 0; round < 2; ++round) {
        EXPECT_EQ(declare(identifier, "/bin/sleep"), kSuccess);
        auto launched = manager_.launch(getpid(), identifier, {"30"});
        ASSERT_TRUE(launched.ok());
        manager_.instances({identifier, "com.example.parallel0"});
        EXPECT_EQ(remove(identifier), kSuccess);
        EXPECT_EQ(WTERMSIG(waitForExit(*launched)), SIGTERM);
      }
    });
  }
  for (auto& thread : threads) thread.join();
}

}  // namespace
}  // namespace ek::stard
