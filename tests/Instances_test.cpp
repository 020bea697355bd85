// Running plug-in instances end when their plug-in is uninstalled.

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <thread>

#include "platform/stard/ServiceManager.h"
#include "tests/EkdProcess.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;

constexpr const char* kShare = "com.corvane.example.notes.share";
constexpr const char* kAction = "com.corvane.example.notes.action";

// Waits for a child of this process; its wait status, or nothing when it is still running
// after the timeout.
std::optional<int> waitForChild(pid_t pid, std::chrono::seconds timeout) {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  while (std::chrono::steady_clock::now() < deadline) {
    int status = 0;
    pid_t done = waitpid(pid, &status, WNOHANG);
    if (done == pid) return status;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return std::nullopt;
}

class PlugInInstances : public ::testing::Test {
 protected:
  void SetUp() override {
    apps_ = daemon_.root().path() / "Applications";
    fs::create_directories(apps_);
    fs::copy(fs::path(EXAMPLES_DIR) / "Applications" / "Notes.app", apps_ / "Notes.app",
             fs::copy_options::recursive);
    ASSERT_TRUE(daemon_.start()) << daemon_.log();
    auto added = daemon_.ekctl({"add", (apps_ / "Notes.app").string()});
    ASSERT_EQ(added.status, 0) << added.err;
    manager_ =
        std::make_unique<stard::FileServiceManager>(daemon_.environment().at("EKORA_RUNTIME_DIR"));
    managerClient_ = ekctlWithEntitlements(daemon_.root().path() / "manager",
                                           {"com.corvane.private.ekora.manager"});
  }
  void TearDown() override {
    for (pid_t pid : children_) {
      ::kill(pid, SIGKILL);
      waitpid(pid, nullptr, 0);
    }
  }

  // Starts an instance of the plug-in through the service manager, as this process's host.
  pid_t launch(const std::string& identifier) {
    EXPECT_EQ(manager_->addExternalService(getpid(), "/host", identifier, "/bin/sleep", {}), 0);
    auto pid = manager_->launch(getpid(), identifier, {"120"});
    EXPECT_TRUE(pid.ok()) << (pid.ok() ? "" : pid.error().message);
    if (!pid.ok()) return -1;
    children_.push_back(*pid);
    return *pid;
  }

  EkdProcess daemon_;
  fs::path apps_;
  std::unique_ptr<stard::FileServiceManager> manager_;
  std::string managerClient_;
  std::vector<pid_t> children_;
};

TEST_F(PlugInInstances, UninstallingTheApplicationEndsEachPlugInsInstances) {
  pid_t share = launch(kShare);
  pid_t action = launch(kAction);
  ASSERT_GT(share, 0);
  ASSERT_GT(action, 0);
  ASSERT_EQ(manager_->instances({kShare, kAction}).size(), 2u);

  auto removed = daemon_.ekctlAs(managerClient_, {"remove", (apps_ / "Notes.app").string()});
  ASSERT_EQ(removed.status, 0) << removed.err;

  for (pid_t pid : {share, action}) {
    auto status = waitForChild(pid, std::chrono::seconds(30));
    ASSERT_TRUE(status.has_value()) << "instance " << pid << " still runs\n" << daemon_.log();
    EXPECT_TRUE(WIFSIGNALED(*status) && WTERMSIG(*status) == SIGTERM);
    std::erase(children_, pid);
  }
  EXPECT_TRUE(manager_->instances({kShare, kAction}).empty());
  EXPECT_TRUE(daemon_.running());
}

TEST_F(PlugInInstances, RefusedRemovalLeavesTheInstanceRunning) {
  pid_t share = launch(kShare);
  ASSERT_GT(share, 0);
  auto refused = daemon_.ekctl({"remove", (apps_ / "Notes.app").string()});
  EXPECT_EQ(refused.status, 1);
  EXPECT_NE(refused.err.find("error 11: caller lacks entitlement for this operation"),
            std::string::npos)
      << refused.err;
  EXPECT_EQ(waitForChild(share, std::chrono::seconds(1)), std::nullopt);
  EXPECT_EQ(manager_->instances({kShare}).size(), 1u);
}

}  // namespace
}  // namespace ek::test
