#include "platform/stard/ServiceManager.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <sstream>
#include <thread>

#include "platform/dmap/Dmap.h"

namespace ek::stard {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

// Long enough that only a broken implementation ever reaches it.
constexpr auto kPatience = 120s;

std::string readFile(const std::string& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

void writeFile(const std::string& path, const std::string& bytes) {
  std::ofstream out(path, std::ios::binary);
  out << bytes;
}

uint64_t ownStartTime() {
  std::string stat = readFile("/proc/self/stat");
  std::istringstream fields(stat.substr(stat.rfind(')') + 2));
  std::string field;
  for (int i = 3; i <= 22; ++i) fields >> field;
  return std::stoull(field);
}

// A pid that no process has: a child that has exited and been reaped.
pid_t exitedPid() {
  pid_t pid = fork();
  if (pid == 0) _exit(0);
  int status = 0;
  waitpid(pid, &status, 0);
  return pid;
}

int waitForExit(pid_t pid) {
  int status = 0;
  while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  return status;
}

std::atomic<int> termsReceived{0};
void countTerm(int) {
  termsReceived.fetch_add(1);
}

class FileServiceManagerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/ek-stard-XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    root_ = pattern;
    manager_ = std::make_unique<FileServiceManager>(root_);
    queue_ = SerialQueue::make("stard-test");
  }
  void TearDown() override {
    std::error_code error;
    fs::remove_all(root_, error);
  }

  std::string declarationFile(pid_t host, const std::string& identifier) const {
    return root_ + "/services/" + std::to_string(host) + "/" + identifier + ".dmap";
  }
  std::string instanceDirectory(const std::string& identifier) const {
    return root_ + "/instances/" + identifier;
  }

  int declare(const std::string& identifier, const std::string& program,
              const Dictionary& overlay = {}, pid_t host = getpid()) {
    return manager_->addExternalService(host, "/usr/bin/host", identifier, program, overlay);
  }

  // The answer of removeExternalService, taken on the queue.
  int remove(const std::string& identifier) {
    auto answered = std::make_shared<std::promise<std::pair<int, bool>>>();
    auto future = answered->get_future();
    auto queue = queue_;
    manager_->removeExternalService(identifier, "1", queue_, [answered, queue](int code) {
      answered->set_value({code, queue->isCurrent()});
    });
    if (future.wait_for(kPatience) != std::future_status::ready) {
      ADD_FAILURE() << "no answer from removeExternalService";
      return -1;
    }
    auto [code, onQueue] = future.get();
    EXPECT_TRUE(onQueue) << "answer must run on the given queue";
    return code;
  }

  std::string root_;
  std::unique_ptr<FileServiceManager> manager_;
  std::shared_ptr<SerialQueue> queue_;
};

TEST_F(FileServiceManagerTest, DeclarationHoldsHostProgramAndOverlay) {
  Dictionary overlay{{"WyreService", Value(Dictionary{{"_SandboxProfile", Value("plugin")}})},
                     {"QvBundlePackageType", Value("WYR!")}};
  ASSERT_EQ(declare("com.example.one", "/opt/one/bin/one", overlay), kSuccess);

  auto file = dmap::readFile(declarationFile(getpid(), "com.example.one"));
  ASSERT_TRUE(file.ok()) << file.error().message;
  EXPECT_EQ(*file, Value(Dictionary{{"host-pid", Value(getpid())},
                                    {"host-path", Value("/usr/bin/host")},
                                    {"program", Value("/opt/one/bin/one")},
                                    {"overlay", Value(overlay)}}));
  auto declaration = manager_->declaration(getpid(), "com.example.one");
  ASSERT_TRUE(declaration.has_value());
  EXPECT_EQ(Value(*declaration), *file);
  EXPECT_FALSE(manager_->declaration(getpid(), "com.example.other").has_value());
}

TEST_F(FileServiceManagerTest, DeclarationStaysValidDmapForOddStrings) {
  const std::vector<std::string> odd = {
      "<dict><key>x</key></dict>", "a & b; &amp; &#65;", "]]> <![CDATA[", "\"quoted\" 'single'",
      "tab\tnew\nline\r",          "ünïcödé ✓ 𝄞",        "   ",           ""};
  for (size_t i = 0; i < odd.size(); ++i) {
    SCOPED_TRACE(odd[i]);
    std::string identifier = "com.example.odd" + std::to_string(i);
    Dictionary overlay{{odd[i], Value(odd[i])}};
    ASSERT_EQ(manager_->addExternalService(getpid(), odd[i], identifier, odd[i], overlay),
              kSuccess);
    auto file = dmap::readFile(declarationFile(getpid(), identifier));
    ASSERT_TRUE(file.ok()) << file.error().message;
    EXPECT_EQ(*file->getString("host-path"), odd[i]);
    EXPECT_EQ(*file->getString("program"), odd[i]);
    EXPECT_EQ(*file->getDictionary("overlay"), overlay);
  }
}

TEST_F(FileServiceManagerTest, ValuesDmapCannotCarryAreRefused) {
  const std::vector<std::string> bad = {std::string("nul\0byte", 8), "bell\x07", "\xff\xfe",
                                        "\xc3"};
  for (const std::string& text : bad) {
    EXPECT_EQ(manager_->addExternalService(getpid(), text, "com.example.bad", "/bin/true", {}),
              EINVAL);
    EXPECT_EQ(manager_->addExternalService(getpid(), "/h", "com.example.bad", text, {}), EINVAL);
    EXPECT_EQ(manager_->addExternalService(getpid(), "/h", "com.example.bad", "/bin/true",
                                           Dictionary{{"k", Value(text)}}),
              EINVAL);
  }
  EXPECT_FALSE(fs::exists(declarationFile(getpid(), "com.example.bad")));
}

TEST_F(FileServiceManagerTest, BadIdentifiersAndHostPidsAreRefused) {
  const std::vector<std::string> bad = {
      "", ".", "..", "a/b", "/abs", "trailing/", std::string("nul\0id", 6), std::string(243, 'x')};
  for (const std::string& identifier : bad) {
    SCOPED_TRACE(identifier);
    EXPECT_EQ(declare(identifier, "/bin/true"), EINVAL);
    EXPECT_EQ(remove(identifier), EINVAL);
    auto launched = manager_->launch(getpid(), identifier);
    ASSERT_FALSE(launched.ok());
    EXPECT_TRUE(launched.error().isPosix(EINVAL));
  }
  EXPECT_EQ(declare("com.example.ok", "/bin/true", {}, 0), EINVAL);
  EXPECT_EQ(declare("com.example.ok", "/bin/true", {}, -5), EINVAL);
  EXPECT_FALSE(fs::exists(root_ + "/services/0"));

  std::string longest(242, 'y');
  EXPECT_EQ(declare(longest, "/bin/true"), kSuccess);
  EXPECT_TRUE(fs::exists(declarationFile(getpid(), longest)));
}

TEST_F(FileServiceManagerTest, WritingPrunesDeclarationsOfExitedHosts) {
  pid_t gone = exitedPid();
  ASSERT_EQ(declare("com.example.a", "/bin/true", {}, gone), kSuccess);
  ASSERT_TRUE(fs::exists(declarationFile(gone, "com.example.a")));
  ASSERT_EQ(declare("com.example.a", "/bin/true"), kSuccess);
  EXPECT_FALSE(fs::exists(root_ + "/services/" + std::to_string(gone)));
  ASSERT_EQ(declare("com.example.b", "/bin/true"), kSuccess);
  EXPECT_TRUE(fs::exists(declarationFile(getpid(), "com.example.a")));
  EXPECT_TRUE(fs::exists(declarationFile(getpid(), "com.example.b")));
}

TEST_F(FileServiceManagerTest, PruneDeclarationsRemovesExitedHostsOnly) {
  pid_t gone = exitedPid();
  ASSERT_EQ(declare("com.example.a", "/bin/true", {}, gone), kSuccess);
  ASSERT_EQ(declare("com.example.a", "/bin/true"), kSuccess);
  // A zombie host has exited too.
  pid_t zombie = fork();
  if (zombie == 0) _exit(0);
  siginfo_t info{};
  ASSERT_EQ(waitid(P_PID, zombie, &info, WEXITED | WNOWAIT), 0);
  fs::create_directories(root_ + "/services/" + std::to_string(zombie));
  writeFile(declarationFile(zombie, "com.example.a"), "x");

  manager_->pruneDeclarations();
  EXPECT_FALSE(fs::exists(root_ + "/services/" + std::to_string(gone)));
  EXPECT_FALSE(fs::exists(root_ + "/services/" + std::to_string(zombie)));
  EXPECT_TRUE(fs::exists(declarationFile(getpid(), "com.example.a")));
  waitForExit(zombie);
}

TEST_F(FileServiceManagerTest, LaunchedInstanceIsListedThenEndedBySigterm) {
  ASSERT_EQ(declare("com.example.sleeper", "/bin/sleep"), kSuccess);
  auto launched = manager_->launch(getpid(), "com.example.sleeper", {"30"});
  ASSERT_TRUE(launched.ok()) << launched.error().message;
  pid_t child = *launched;

  auto running = manager_->instances({"com.example.sleeper", "com.example.none"});
  ASSERT_EQ(running.size(), 1u);
  EXPECT_EQ(running[0].pid, child);
  EXPECT_EQ(running[0].bundleIdentifier, "com.example.sleeper");
  EXPECT_EQ(running[0].hostPid, getpid());
  EXPECT_EQ(running[0].program, "/bin/sleep");
  auto entry = dmap::readFile(instanceDirectory("com.example.sleeper") + "/" +
                              std::to_string(child) + ".dmap");
  ASSERT_TRUE(entry.ok());
  EXPECT_NE(entry->getUnsigned("start-time"), nullptr);

  EXPECT_EQ(remove("com.example.sleeper"), kSuccess);
  int status = waitForExit(child);
  ASSERT_TRUE(WIFSIGNALED(status));
  EXPECT_EQ(WTERMSIG(status), SIGTERM);
  EXPECT_TRUE(manager_->instances({"com.example.sleeper"}).empty());
  EXPECT_FALSE(manager_->declaration(getpid(), "com.example.sleeper").has_value());
  // Removal also ended the plug-in's declarations: nothing more can be launched.
  EXPECT_FALSE(manager_->launch(getpid(), "com.example.sleeper", {"30"}).ok());
}

TEST_F(FileServiceManagerTest, RemovalEndsEveryInstanceOfEveryHost) {
  pid_t otherHost = fork();
  if (otherHost == 0) {
    pause();
    _exit(0);
  }
  ASSERT_EQ(declare("com.example.multi", "/bin/sleep"), kSuccess);
  ASSERT_EQ(declare("com.example.multi", "/bin/sleep", {}, otherHost), kSuccess);
  auto first = manager_->launch(getpid(), "com.example.multi", {"30"});
  auto second = manager_->launch(otherHost, "com.example.multi", {"30"});
  ASSERT_TRUE(first.ok() && second.ok());
  EXPECT_EQ(manager_->instances({"com.example.multi"}).size(), 2u);

  EXPECT_EQ(remove("com.example.multi"), kSuccess);
  EXPECT_EQ(WTERMSIG(waitForExit(*first)), SIGTERM);
  EXPECT_EQ(WTERMSIG(waitForExit(*second)), SIGTERM);
  EXPECT_FALSE(fs::exists(declarationFile(otherHost, "com.example.multi")));
  EXPECT_FALSE(fs::exists(declarationFile(getpid(), "com.example.multi")));
  kill(otherHost, SIGKILL);
  waitForExit(otherHost);
}

TEST_F(FileServiceManagerTest, RemovalWithNothingRunningAnswersNoSuchProcess) {
  EXPECT_EQ(remove("com.example.idle"), kNoSuchProcess);
  ASSERT_EQ(declare("com.example.idle", "/bin/true"), kSuccess);
  EXPECT_EQ(remove("com.example.idle"), kNoSuchProcess);
  EXPECT_FALSE(fs::exists(declarationFile(getpid(), "com.example.idle")));
}

TEST_F(FileServiceManagerTest, AnswerIsNeverGivenOnTheCallersStack) {
  // Shared, so that the answering thread may still be unlocking after the test has returned.
  struct State {
    std::mutex mutex;
    bool answeredInline = false;
    bool returned = false;
    std::promise<void> done;
  };
  auto state = std::make_shared<State>();
  auto answered = state->done.get_future();
  {
    std::lock_guard lock(state->mutex);
    manager_->removeExternalService("com.example.idle", "1", queue_, [state](int) {
      {
        std::lock_guard inner(state->mutex);
        state->answeredInline = !state->returned;
      }
      state->done.set_value();
    });
    state->returned = true;
  }
  ASSERT_EQ(answered.wait_for(kPatience), std::future_status::ready);
  std::lock_guard lock(state->mutex);
  EXPECT_FALSE(state->answeredInline);
}

TEST_F(FileServiceManagerTest, OverlayEnvironmentReachesTheChild) {
  ASSERT_EQ(setenv("EK_STARD_INHERITED", "from-daemon", 1), 0);
  ASSERT_EQ(setenv("EK_STARD_OVERRIDDEN", "from-daemon", 1), 0);
  std::string output = root_ + "/env.out";
  Dictionary variables{{"FOO", Value("bar baz $HOME")},
                       {"EK_STARD_OVERRIDDEN", Value("from-overlay")},
                       {"NUMBER", Value(5)},
                       {"BAD=NAME", Value("x")}};
  Dictionary overlay{
      {"WyreService", Value(Dictionary{{"EnvironmentVariables", Value(variables)}})}};
  ASSERT_EQ(declare("com.example.env", "/bin/sh", overlay), kSuccess);
  auto launched =
      manager_->launch(getpid(), "com.example.env",
                       {"-c",
                        "printf '%s|%s|%s|%s' \"$FOO\" \"${NUMBER-unset}\" \"$EK_STARD_INHERITED\" "
                        "\"$EK_STARD_OVERRIDDEN\" > \"$0\"",
                        output});
  ASSERT_TRUE(launched.ok()) << launched.error().message;
  int status = waitForExit(*launched);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
  EXPECT_EQ(readFile(output), "bar baz $HOME|unset|from-daemon|from-overlay");
  unsetenv("EK_STARD_INHERITED");
  unsetenv("EK_STARD_OVERRIDDEN");
}

TEST_F(FileServiceManagerTest, ChildStartsWithSigtermUnblocked) {
  sigset_t term;
  sigemptyset(&term);
  sigaddset(&term, SIGTERM);
  sigset_t previous;
  ASSERT_EQ(pthread_sigmask(SIG_BLOCK, &term, &previous), 0);
  ASSERT_EQ(declare("com.example.masked", "/bin/sleep"), kSuccess);
  auto launched = manager_->launch(getpid(), "com.example.masked", {"30"});
  pthread_sigmask(SIG_SETMASK, &previous, nullptr);
  ASSERT_TRUE(launched.ok());
  EXPECT_EQ(remove("com.example.masked"), kSuccess);
  EXPECT_EQ(WTERMSIG(waitForExit(*launched)), SIGTERM);
}

TEST_F(FileServiceManagerTest, LaunchWithoutDeclarationIsNotFound) {
  auto launched = manager_->launch(getpid(), "com.example.undeclared", {"30"});
  ASSERT_FALSE(launched.ok());
  EXPECT_TRUE(launched.error().isPosix(ENOENT)) << launched.error().message;
}

TEST_F(FileServiceManagerTest, LaunchOfMissingProgramFailsAndRecordsNothing) {
  ASSERT_EQ(declare("com.example.missing", root_ + "/no-such-program"), kSuccess);
  auto launched = manager_->launch(getpid(), "com.example.missing");
  ASSERT_FALSE(launched.ok());
  EXPECT_TRUE(launched.error().isPosix(ENOENT)) << launched.error().message;
  EXPECT_TRUE(manager_->instances({"com.example.missing"}).empty());
}

class StaleEntryTest : public FileServiceManagerTest {
 protected:
  void SetUp() override {
    FileServiceManagerTest::SetUp();
    termsReceived = 0;
    struct sigaction action {};
    action.sa_handler = countTerm;
    sigemptyset(&action.sa_mask);
    sigaction(SIGTERM, &action, &previous_);
  }
  void TearDown() override {
    sigaction(SIGTERM, &previous_, nullptr);
    FileServiceManagerTest::TearDown();
  }

  std::string writeEntry(const std::string& identifier, pid_t pid, uint64_t startTime) {
    fs::create_directories(instanceDirectory(identifier));
    std::string path = instanceDirectory(identifier) + "/" + std::to_string(pid) + ".dmap";
    auto written =
        dmap::writeFileAtomically(path, Value(Dictionary{{"pid", Value(pid)},
                                                         {"start-time", Value(startTime)},
                                                         {"host-pid", Value(getpid())},
                                                         {"program", Value("/bin/sleep")}}));
    EXPECT_TRUE(written.ok());
    return path;
  }

  struct sigaction previous_ {};
};

TEST_F(StaleEntryTest, RecycledPidIsPrunedAndNeverSignalled) {
  std::string recycled = writeEntry("com.example.stale", getpid(), ownStartTime() + 12345);
  std::string gone = writeEntry("com.example.stale", exitedPid(), ownStartTime());
  EXPECT_EQ(remove("com.example.stale"), kNoSuchProcess);
  EXPECT_EQ(termsReceived.load(), 0);
  EXPECT_FALSE(fs::exists(recycled));
  EXPECT_FALSE(fs::exists(gone));

  std::string listed = writeEntry("com.example.listed", getpid(), ownStartTime() + 1);
  EXPECT_TRUE(manager_->instances({"com.example.listed"}).empty());
  EXPECT_FALSE(fs::exists(listed));
  EXPECT_EQ(termsReceived.load(), 0);
}

TEST_F(StaleEntryTest, EntryOfTheRecordedProcessIsListed) {
  writeEntry("com.example.self", getpid(), ownStartTime());
  auto listed = manager_->instances({"com.example.self"});
  ASSERT_EQ(listed.size(), 1u);
  EXPECT_EQ(listed[0].pid, getpid());
}

TEST_F(StaleEntryTest, ZombieInstanceIsGone) {
  pid_t zombie = fork();
  if (zombie == 0) _exit(0);
  siginfo_t info{};
  ASSERT_EQ(waitid(P_PID, zombie, &info, WEXITED | WNOWAIT), 0);
  std::string stat = readFile("/proc/" + std::to_string(zombie) + "/stat");
  std::istringstream fields(stat.substr(stat.rfind(')') + 2));
  std::string field;
  for (int i = 3; i <= 22; ++i) fields >> field;
  std::string path = writeEntry("com.example.zombie", zombie, std::stoull(field));
  EXPECT_TRUE(manager_->instances({"com.example.zombie"}).empty());
  EXPECT_FALSE(fs::exists(path));
  waitForExit(zombie);
}

TEST_F(FileServiceManagerTest, GarbageEntryFilesAreRemoved) {
  const std::string directory = instanceDirectory("com.example.junk");
  fs::create_directories(directory);
  const std::vector<std::pair<std::string, std::string>> garbage = {
      {"not-a-pid.dmap", "<dmap version=\"1.0\"><dict/></dmap>"},
      {"101.dmap", "not dmap at all"},
      {"102.dmap", "<dmap version=\"1.0\"><array/></dmap>"},
      {"103.dmap",
       "<dmap version=\"1.0\"><dict><key>pid</key><integer>999</integer>"
       "<key>start-time</key><integer>1</integer><key>host-pid</key>"
       "<integer>1</integer><key>program</key><string>x</string></dict></dmap>"},
      {"104.dmap", std::string(65 * 1024, ' ')},
      {"105", "<dmap version=\"1.0\"><dict/></dmap>"},
  };
  for (const auto& [name, bytes] : garbage) writeFile(directory + "/" + name, bytes);
  writeFile(directory + "/.104.dmap.inprogress", "partial");

  EXPECT_TRUE(manager_->instances({"com.example.junk"}).empty());
  for (const auto& [name, bytes] : garbage) {
    EXPECT_FALSE(fs::exists(directory + "/" + name)) << name;
  }
  // A write in progress is not garbage.
  EXPECT_TRUE(fs::exists(directory + "/.104.dmap.inprogress"));
}

TEST_F(FileServiceManagerTest, ConcurrentLaunchesAndRemovalsEachEndTheirInstance) {
  constexpr int kThreads = 4;
  std::vector<std::thread> threads;
  std::atomic<int> failures{0};
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      std::string identifier = "com.example.parallel" + std::to_string(t);
      for (int round = 0; round < 3; ++round) {
        if (declare(identifier, "/bin/sleep") != kSuccess) ++failures;
        auto launched = manager_->launch(getpid(), identifier, {"30"});
        if (!launched.ok()) {
          ++failures;
          continue;
        }
        manager_->instances({identifier, "com.example.parallel0"});
        if (remove(identifier) != kSuccess) ++failures;
        int status = waitForExit(*launched);
        if (!WIFSIGNALED(status) || WTERMSIG(status) != SIGTERM) ++failures;
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);
}

TEST(ServiceManagerTransactions, CountFollowsBeginAndEnd) {
  FakeServiceManager manager;
  EXPECT_EQ(manager.transactionCount(), 0);
  manager.beginTransaction();
  manager.beginTransaction();
  manager.endTransaction();
  EXPECT_EQ(manager.transactionCount(), 1);
}

class FakeServiceManagerTest : public ::testing::Test {
 protected:
  // Posts the removal and reports whether its answer has run once the queue is drained.
  std::shared_ptr<std::promise<int>> removeAsync(const std::string& identifier) {
    auto answered = std::make_shared<std::promise<int>>();
    manager_.removeExternalService(identifier, "2.0", queue_,
                                   [answered](int code) { answered->set_value(code); });
    return answered;
  }

  FakeServiceManager manager_;
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::make("fake-stard-test");
};

TEST_F(FakeServiceManagerTest, RemovalIsRecordedAndAnsweredAsSet) {
  manager_.setRemovalAnswer("com.example.running", kSuccess);
  auto running = removeAsync("com.example.running")->get_future();
  auto idle = removeAsync("com.example.idle")->get_future();
  ASSERT_EQ(running.wait_for(kPatience), std::future_status::ready);
  ASSERT_EQ(idle.wait_for(kPatience), std::future_status::ready);
  EXPECT_EQ(running.get(), kSuccess);
  EXPECT_EQ(idle.get(), kNoSuchProcess);
  auto removals = manager_.removals();
  ASSERT_EQ(removals.size(), 2u);
  EXPECT_EQ(removals[0].bundleIdentifier, "com.example.running");
  EXPECT_EQ(removals[0].version, "2.0");
  EXPECT_EQ(removals[1].bundleIdentifier, "com.example.idle");
}

TEST_F(FakeServiceManagerTest, HeldAnswersWaitForRelease) {
  manager_.holdAnswers("com.example.held");
  auto held = removeAsync("com.example.held")->get_future();
  auto free = removeAsync("com.example.free")->get_future();
  // Anything posted before this block has run by the time it returns.
  queue_->sync([] {});
  EXPECT_EQ(free.wait_for(0s), std::future_status::ready);
  EXPECT_NE(held.wait_for(0s), std::future_status::ready);

  manager_.releaseHeldAnswers();
  ASSERT_EQ(held.wait_for(kPatience), std::future_status::ready);
  EXPECT_EQ(held.get(), kNoSuchProcess);
  // Released holds are over: the next removal is answered at once.
  auto again = removeAsync("com.example.held")->get_future();
  ASSERT_EQ(again.wait_for(kPatience), std::future_status::ready);
}

TEST_F(FakeServiceManagerTest, DeclarationsAndInstancesAreKept) {
  manager_.addResult = 5;
  Dictionary overlay{{"QvBundlePackageType", Value("WYR!")}};
  EXPECT_EQ(manager_.addExternalService(42, "/host", "com.example.a", "/prog", overlay), 5);
  auto declarations = manager_.declarations();
  ASSERT_EQ(declarations.size(), 1u);
  EXPECT_EQ(declarations[0].hostPid, 42);
  EXPECT_EQ(declarations[0].hostPath, "/host");
  EXPECT_EQ(declarations[0].bundleIdentifier, "com.example.a");
  EXPECT_EQ(declarations[0].program, "/prog");
  EXPECT_EQ(declarations[0].overlay, overlay);

  manager_.addInstance({100, "com.example.a", 42, "/prog"});
  manager_.addInstance({101, "com.example.b", 42, "/prog"});
  auto listed = manager_.instances({"com.example.b"});
  ASSERT_EQ(listed.size(), 1u);
  EXPECT_EQ(listed[0].pid, 101);

  auto launched = manager_.launch(42, "com.example.a");
  ASSERT_FALSE(launched.ok());
  EXPECT_TRUE(launched.error().isPosix(ENOTSUP));
}

}  // namespace
}  // namespace ek::stard
