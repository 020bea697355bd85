#include "platform/codesign/CodeSigning.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "platform/dmap/Dmap.h"
#include "platform/log/testing/CapturingSink.h"
#include "platform/testing/Files.h"

namespace ek {
namespace {

const Dictionary kEntitlements{{"com.corvane.ekd.private", Value(true)},
                               {"com.corvane.ekd.level", Value(3)}};

TEST(CodeSigningTrust, OnlyRegularFilesOfRootOrTheUserWritableByNoOneElseVouch) {
  constexpr uid_t kSelf = 1000;
  const std::tuple<mode_t, uid_t, bool> cases[] = {
      {S_IFREG | 0644, kSelf, true},  {S_IFREG | 0755, 0, true},
      {S_IFREG | 0400, kSelf, true},  {S_IFREG | 0664, kSelf, false},
      {S_IFREG | 0774, 0, false},     {S_IFREG | 0646, kSelf, false},
      {S_IFREG | 0777, 0, false},     {S_IFREG | 0644, 65534, false},
      {S_IFDIR | 0755, kSelf, false}, {S_IFIFO | 0644, kSelf, false},
  };
  for (const auto& [mode, owner, trusted] : cases) {
    struct stat st {};
    st.st_mode = mode;
    st.st_uid = owner;
    EXPECT_EQ(untrustedReason(st, "file", kSelf).empty(), trusted)
        << std::oct << mode << " of uid " << std::dec << owner;
  }
}

class CodeSigningFiles : public ::testing::Test {
 protected:
  void SetUp() override { log::setSink(sink_); }
  void TearDown() override { log::setSink(nullptr); }

  static void write(const std::string& path, std::string_view bytes, mode_t mode) {
    ASSERT_TRUE(testing::writeFile(path, bytes));
    ASSERT_EQ(chmod(path.c_str(), mode), 0);
  }
  int refusalsOf(const std::string& executable) const {
    return sink_->countIf([&](const log::testing::CapturingSink::Line& line) {
      return line.level == log::Level::Error &&
             line.message.starts_with("ignoring entitlements of " + executable + ": ");
    });
  }

  testing::TempDir dir_;
  const std::string entitlements_ = dmap::write(Value(kEntitlements)).value();
  std::shared_ptr<log::testing::CapturingSink> sink_ =
      std::make_shared<log::testing::CapturingSink>();
};

TEST_F(CodeSigningFiles, OnlyATrustedDictionaryVouchesAndEachRefusalIsLoggedOnce) {
  auto file = [](std::string bytes, mode_t mode, mode_t programMode = 0755) {
    return [=](const std::string& program) {
      write(program + ".entitlements", bytes, mode);
      chmod(program.c_str(), programMode);
    };
  };
  // Name, how its files are made, whether they are honoured, refusals logged.
  const std::tuple<const char*, std::function<void(const std::string&)>, bool, int> cases[] = {
      {"plain", file(entitlements_, 0644), true, 0},
      {"missing", [](const std::string&) {}, false, 0},
      {"group-writable", file(entitlements_, 0664), false, 1},
      {"group-writable program", file(entitlements_, 0644, 0775), false, 1},
      {"malformed", file("<dmap version=\"1.0\"><dict><key>a", 0644), false, 1},
      {"oversized", file(std::string(2 * 1024 * 1024, ' '), 0644), false, 1},
      {"fifo", [](auto& program) { mkfifo((program + ".entitlements").c_str(), 0644); }, false, 1},
      {"symbolic link",  // to the trusted file of the first case
       [&](auto& program) {
         symlink(dir_.file("plain.entitlements").c_str(), (program + ".entitlements").c_str());
       },
       false, 1},
  };
  for (const auto& [name, make, honoured, logged] : cases) {
    SCOPED_TRACE(name);
    const std::string program = dir_.file(name);
    write(program, "#!/bin/sh\n", 0755);
    make(program);
    for (int read = 0; read < 2; ++read) {
      EXPECT_EQ(CodeSigning::system()->entitlementsForExecutable(program),
                honoured ? kEntitlements : Dictionary{});
    }
    EXPECT_EQ(refusalsOf(program), logged);
  }
}

// A running copy of sleep stands in for a client.
TEST_F(CodeSigningFiles, ProcessIsVouchedForOnlyByTheFileItRuns) {
  const std::string program = dir_.file("sleeper");
  std::filesystem::copy_file("/bin/sleep", program);
  write(program + ".entitlements", entitlements_, 0644);
  AuditToken token;
  token.pid = fork();
  if (token.pid == 0) {
    execl(program.c_str(), program.c_str(), "30", static_cast<char*>(nullptr));
    _exit(127);
  }
  for (int i = 0; i < 5000 && executablePathForPid(token.pid) != program; ++i) usleep(1000);
  auto value = [&] {
    return CodeSigning::system()->taskForAuditToken(token)->entitlementValue(
        "com.corvane.ekd.level");
  };
  EXPECT_EQ(value().value(), std::optional<Value>(Value(3)));
  // Another file now lies at the path, with trusted entitlements next to it.
  std::filesystem::remove(program);
  write(program, "#!/bin/sh\n", 0755);
  EXPECT_EQ(value().value(), std::nullopt);
  EXPECT_EQ(refusalsOf(program), 1);
  kill(token.pid, SIGKILL);
  waitpid(token.pid, nullptr, 0);
  EXPECT_FALSE(value().ok());
}

}  // namespace
}  // namespace ek
