// ekd's and ekctl's command lines and exit statuses, against a real daemon.
#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "tests/EkdProcess.h"

namespace ek::test {
namespace {

constexpr const char* kUsage = "Usage: ekd [-S servicename] [-v]\n";

TEST(EkdCommandLine, BadCommandLinesPrintUsageAndExitTwo) {
  TempDir dir;
  std::map<std::string, std::string> env{{"EKORA_RUNTIME_DIR", dir.path().string()},
                                         {"EKORA_STATE_DIR", dir.path().string()}};
  for (auto args : std::vector<std::vector<std::string>>{
           {"-S"}, {"stray"}, {"-S", "com.example.x", "stray"}, {"-x"}, {"-c"}}) {
    args.insert(args.begin(), ekdPath());
    auto result = runCommand(args, env);
    EXPECT_EQ(result.status, 2) << args.back();
    EXPECT_NE(result.err.find(kUsage), std::string::npos) << result.err;
  }
}

TEST(EkdCommandLine, ServiceNameThatIsNotAFileNameCannotBeServed) {
  TempDir dir;
  std::map<std::string, std::string> env{{"EKORA_RUNTIME_DIR", (dir.path() / "run").string()},
                                         {"EKORA_STATE_DIR", dir.path().string()}};
  auto result = runCommand({ekdPath(), "-S", "../escape"}, env);
  EXPECT_EQ(result.status, 1);
  EXPECT_NE(result.err.find("unable to construct server"), std::string::npos);
  EXPECT_FALSE(std::filesystem::exists(dir.path() / "escape"));
}

TEST(EkdCommandLine, EachVerboseOptionLogsThatItIsIneffective) {
  EkdProcess daemon({"-v", "-v", "-c", "abc"});
  ASSERT_TRUE(daemon.start());
  EXPECT_EQ(daemon.terminate(), 0);
  std::string log = daemon.log();
  size_t count = 0;
  for (size_t at = 0; (at = log.find("verbose option -v is ineffective", at)) != std::string::npos;
       ++at) {
    ++count;
  }
  EXPECT_EQ(count, 2u) << log;
}

class EkctlAgainstDaemon : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    daemon_ = new EkdProcess();
    ASSERT_TRUE(daemon_->start());
  }
  static void TearDownTestSuite() {
    EXPECT_EQ(daemon_->terminate(), 0);
    delete daemon_;
  }
  static EkdProcess* daemon_;
};

EkdProcess* EkctlAgainstDaemon::daemon_ = nullptr;

TEST_F(EkctlAgainstDaemon, RawPrintsTheReplyAndExitsZero) {
  auto result = daemon_->ekctl({"raw", R"({"request": "Add", "version": 3})"});
  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(result.out, "{\"error\":\"unrecognized request\",\"errorcode\":4}\n");
}

TEST_F(EkctlAgainstDaemon, RawReadsTheRequestFromStandardInput) {
  auto result = daemon_->ekctl({"raw"}, R"({"request": "find"})");
  EXPECT_EQ(result.status, 0);
  EXPECT_NE(result.out.find("unsupported protocol version 0 (current 3)"), std::string::npos);
}

TEST_F(EkctlAgainstDaemon, ErrorRepliesExitOneWithTheCodeOnStandardError) {
  auto result = daemon_->ekctl({"find", "--uuid", "e621e1f8-c36c-495a-93fc-0c247a3e6e5f"});
  EXPECT_EQ(result.status, 1);
  EXPECT_NE(result.err.find("ekctl: error "), std::string::npos) << result.err;
}

TEST_F(EkctlAgainstDaemon, UsageErrorsExitTwo) {
  for (auto args : std::vector<std::vector<std::string>>{{},
                                                         {"frobnicate"},
                                                         {"find", "--uuid", "not-a-uuid"},
                                                         {"raw", "{not json"},
                                                         {"match", "[1, 2]"},
                                                         {"annotate", "--set", "{}"}}) {
    auto result = daemon_->ekctl(args);
    EXPECT_EQ(result.status, 2) << (args.empty() ? "(none)" : args[0]) << ": " << result.err;
  }
}

TEST_F(EkctlAgainstDaemon, OptionsMayFollowTheCommand) {
  auto result = daemon_->ekctl({"bulk", "--json", "--timeout", "5"});
  EXPECT_EQ(result.status, 0) << result.err;
  EXPECT_EQ(result.out, "{}\n");
  auto zero = daemon_->ekctl({"bulk", "--timeout", "0"});
  EXPECT_EQ(zero.status, 2);
  EXPECT_LT(zero.err.size(), 120u) << zero.err;
}

// Plain JSON for jq: one shape per command, typed values as text.
TEST_F(EkctlAgainstDaemon, ListAndInfoAnswerPlainJson) {
  std::string app = (daemon_->root().path() / "Notes.app").string();
  std::filesystem::copy(std::filesystem::path(EXAMPLES_DIR) / "Applications/Notes.app", app,
                        std::filesystem::copy_options::recursive);
  ASSERT_EQ(daemon_->ekctl({"add", app, "-o", "json"}).out, "{\n  \"ok\": true\n}\n");
  auto listed = daemon_->ekctl({"list", "--point", "com.corvane.share", "-o", "json"});
  ASSERT_EQ(listed.status, 0) << listed.err;
  auto plugIns = nlohmann::json::parse(listed.out);
  ASSERT_TRUE(plugIns.is_array());
  ASSERT_EQ(plugIns.size(), 1u) << listed.out;
  std::string uuid = plugIns[0]["uuid"];
  EXPECT_EQ(plugIns[0]["identifier"], "com.corvane.example.notes.share");
  EXPECT_TRUE(plugIns[0]["extensions"]["."].is_string());
  EXPECT_EQ(daemon_->ekctl({"list", "--app", "/elsewhere.app", "-o", "json"}).out, "[]\n");

  for (const std::string& target :
       {std::string("com.corvane.example.notes.share"), uuid, app + "/PlugIns/Share.appex"}) {
    auto info = daemon_->ekctl({"info", target, "-o", "json"});
    ASSERT_EQ(info.status, 0) << target << ": " << info.err;
    EXPECT_EQ(nlohmann::json::parse(info.out)["uuid"], uuid) << target;
  }
  auto missing = daemon_->ekctl({"info", "com.example.none", "-o", "json"});
  EXPECT_EQ(missing.status, 1);
  EXPECT_EQ(nlohmann::json::parse(missing.out)["error"]["code"], 4);
}

TEST_F(EkctlAgainstDaemon, RefusedRemovalSaysWhichEntitlementAndWhere) {
  auto result = daemon_->ekctl({"remove", "/nonexistent.app"});
  EXPECT_EQ(result.status, 1);
  EXPECT_NE(result.err.find("com.corvane.private.ekora.manager"), std::string::npos) << result.err;
  EXPECT_NE(result.err.find(ekctlPath() + ".entitlements"), std::string::npos) << result.err;
}

TEST(Ekctl, PrintsItsVersion) {
  auto result = runCommand({ekctlPath(), "--version"});
  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(result.out.rfind("ekctl ", 0), 0u) << result.out;
}

TEST(Ekctl, UnreachableDaemonIsATransportError) {
  TempDir dir;
  auto result = runCommand({ekctlPath(), "-S", "com.corvane.ekora.absent", "bulk"},
                           {{"EKORA_RUNTIME_DIR", dir.path().string()}});
  EXPECT_EQ(result.status, 3);
  EXPECT_NE(result.err.find("cannot reach"), std::string::npos) << result.err;
}

TEST(Ekctl, RawAgainstAnUnreachableDaemonIsATransportError) {
  TempDir dir;
  auto result = runCommand({ekctlPath(), "-S", "com.corvane.ekora.absent", "raw", "{}"},
                           {{"EKORA_RUNTIME_DIR", dir.path().string()}});
  EXPECT_EQ(result.status, 3);
}

}  // namespace
}  // namespace ek::test
