#include "platform/stard/ServiceManager.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <thread>

#include "platform/dmap/Dmap.h"
#include "platform/testing/Files.h"

namespace ek::stard {
namespace {

namespace fs = std::filesystem;

// Field 22 of /proc/<pid>/stat.
uint64_t startTime(pid_t pid) {
  std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
  std::string field;
  std::getline(stat, field, ')');
  for (int i = 3; i <= 22; ++i) stat >> field;
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
  waitpid(pid, &status, 0);
  return status;
}

class FileServiceManagerTest : public ::testing::Test {
 protected:
  std::string declarationFile(pid_t host, const std::string& identifier) const {
    return root_.file("services/" + std::to_string(host) + "/" + identifier + ".dmap");
  }
  int declare(const std::string& identifier, const std::string& program, pid_t host = getpid(),
              const Dictionary& overlay = {}) {
    return manager_.addExternalService(host, "/usr/bin/host", identifier, program, overlay);
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
  const Dictionary overlay{{"WyreService", Value(Dictionary{{"<k>&amp;", Value("]]>\n𝄞")}})}};
  ASSERT_EQ(declare("com.example.one", "/opt/one", getpid(), overlay), kSuccess);
  const Value expected(Dictionary{{"host-pid", Value(getpid())},
                                  {"host-path", Value("/usr/bin/host")},
                                  {"program", Value("/opt/one")},
                                  {"overlay", Value(overlay)}});
  EXPECT_EQ(dmap::readFile(declarationFile(getpid(), "com.example.one")).value(), expected);
  EXPECT_EQ(Value(manager_.declaration(getpid(), "com.example.one").value()), expected);

  for (const std::string& identifier : {std::string(), std::string(".."), std::string("a/b"),
                                        std::string("nul\0id", 6), std::string(243, 'x')}) {
    EXPECT_EQ(declare(identifier, "/bin/true"), EINVAL) << identifier;
    EXPECT_EQ(remove(identifier), EINVAL) << identifier;
    EXPECT_TRUE(manager_.launch(getpid(), identifier).error().isPosix(EINVAL)) << identifier;
  }
  EXPECT_EQ(declare("com.example.bad", "/bin/true", 0), EINVAL);
  // Text the file cannot carry.
  EXPECT_EQ(declare("com.example.bad", std::string("nul\0byte", 8)), EINVAL);
  EXPECT_EQ(declare("com.example.bad", "/p", getpid(), {{"k", Value("\xff\xfe")}}), EINVAL);
  EXPECT_FALSE(fs::exists(declarationFile(getpid(), "com.example.bad")));

  // Declarations of hosts that have exited are pruned.
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

TEST_F(FileServiceManagerTest, InstancesGetTheOverlayEnvironmentAndRemovalEndsThemAll) {
  pid_t otherHost = fork();
  if (otherHost == 0) {
    pause();
    _exit(0);
  }
  setenv("EK_STARD_OVERRIDDEN", "daemon", 1);  // PATH, inherited too, finds sleep
  const Dictionary variables{{"EK_STARD_OVERRIDDEN", Value("overlay $HOME")}, {"NUMBER", Value(5)}};
  const Dictionary overlay{
      {"WyreService", Value(Dictionary{{"EnvironmentVariables", Value(variables)}})}};
  ASSERT_EQ(declare("com.example.multi", "/bin/sh", getpid(), overlay), kSuccess);
  ASSERT_EQ(declare("com.example.multi", "/bin/sh", otherHost, overlay), kSuccess);
  // An instance must not inherit a blocked SIGTERM, or removal could not end it.
  sigset_t term, previous;
  sigemptyset(&term);
  sigaddset(&term, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &term, &previous);
  const std::vector<std::string> script = {
      "-c",
      "[ \"$EK_STARD_OVERRIDDEN|${NUMBER-unset}\" = 'overlay $HOME|unset' ] && exec sleep 30"};
  auto first = manager_.launch(getpid(), "com.example.multi", script);
  auto second = manager_.launch(otherHost, "com.example.multi", script);
  pthread_sigmask(SIG_SETMASK, &previous, nullptr);
  ASSERT_TRUE(first.ok() && second.ok());

  EXPECT_EQ(manager_.instances({"com.example.multi", "com.example.none"}).size(), 2u);
  EXPECT_EQ(remove("com.example.multi"), kSuccess);
  for (pid_t instance : {*first, *second}) EXPECT_EQ(WTERMSIG(waitForExit(instance)), SIGTERM);
  EXPECT_FALSE(fs::exists(declarationFile(otherHost, "com.example.multi")));
  EXPECT_EQ(remove("com.example.multi"), kNoSuchProcess);
  kill(otherHost, SIGKILL);
  waitForExit(otherHost);

  ASSERT_EQ(declare("com.example.missing", root_.file("no-such-program")), kSuccess);
  for (const char* identifier : {"com.example.missing", "com.example.multi"}) {
    EXPECT_TRUE(manager_.launch(getpid(), identifier).error().isPosix(ENOENT)) << identifier;
    EXPECT_TRUE(manager_.instances({identifier}).empty()) << identifier;
  }
}

TEST_F(FileServiceManagerTest, StaleOrGarbageEntriesArePrunedAndNeverSignalled) {
  // A SIGTERM sent to the wrong process would end this test's own.
  auto entry = [&](pid_t pid, uint64_t start) {
    return dmap::write(Value(Dictionary{{"pid", Value(pid)},
                                        {"start-time", Value(start)},
                                        {"host-pid", Value(getpid())},
                                        {"program", Value("/bin/sleep")}}))
        .value();
  };
  const pid_t gone = exitedChild(), zombie = exitedChild(true), self = getpid();
  const std::pair<std::string, std::string> stale[] = {
      {std::to_string(self), entry(self, startTime(self) + 1)},  // a recycled pid
      {std::to_string(gone), entry(gone, startTime(self))},
      {std::to_string(zombie), entry(zombie, startTime(zombie))},
      {"101", "not dmap at all"},
      {"102", entry(999, 1)},
      {"103", std::string(65 * 1024, ' ')},
  };
  const std::string directory = root_.file("instances/com.example.stale/");
  for (const auto& [name, bytes] : stale) testing::writeFile(directory + name + ".dmap", bytes);
  testing::writeFile(directory + ".103.dmap.inprogress", "partial");

  EXPECT_EQ(remove("com.example.stale"), kNoSuchProcess);
  for (const auto& [name, bytes] : stale) EXPECT_FALSE(fs::exists(directory + name + ".dmap"));
  EXPECT_TRUE(fs::exists(directory + ".103.dmap.inprogress"));  // a write in progress
  waitForExit(zombie);
  // The same entry with the right start time is ours.
  testing::writeFile(directory + std::to_string(self) + ".dmap", entry(self, startTime(self)));
  EXPECT_EQ(manager_.instances({"com.example.stale"}).size(), 1u);
}

TEST_F(FileServiceManagerTest, ConcurrentLaunchesAndRemovalsEachEndTheirInstance) {
  std::vector<std::jthread> threads;
  for (const char* identifier : {"com.example.a", "com.example.b", "com.example.c"}) {
    threads.emplace_back([this, identifier] {
      EXPECT_EQ(declare(identifier, "/bin/sleep"), kSuccess);
      auto launched = manager_.launch(getpid(), identifier, {"30"});
      ASSERT_TRUE(launched.ok());
      EXPECT_EQ(remove(identifier), kSuccess);
      EXPECT_EQ(WTERMSIG(waitForExit(*launched)), SIGTERM);
    });
  }
}

}  // namespace
}  // namespace ek::stard
