#include "platform/codesign/CodeSigning.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <mutex>
#include <vector>

#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"

namespace ek {
namespace {

class CapturingSink : public log::Sink {
 public:
  void write(const log::Record& record) override {
    std::lock_guard lock(mutex_);
    lines_.push_back(std::string(record.category) + "/" +
                     std::string(log::levelName(record.level)) + ": " +
                     std::string(record.message));
  }
  std::vector<std::string> lines() {
    std::lock_guard lock(mutex_);
    return lines_;
  }

 private:
  std::mutex mutex_;
  std::vector<std::string> lines_;
};

void writeFile(const std::string& path, std::string_view bytes, mode_t mode) {
  std::ofstream(path, std::ios::binary | std::ios::trunc) << bytes;
  ASSERT_EQ(chmod(path.c_str(), mode), 0);
}

std::string dmapText(const Value& value) {
  auto text = dmap::write(value);
  EXPECT_TRUE(text.ok());
  return text.ok() ? *text : std::string();
}

const Dictionary kEntitlements{{"com.corvane.ekd.private", Value(true)},
                               {"com.corvane.ekd.level", Value(3)}};

class CodeSigningFiles : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (std::filesystem::temp_directory_path() / "ekcs.XXXXXX").string();
    ASSERT_NE(mkdtemp(pattern.data()), nullptr);
    directory_ = pattern;
    // Each test gets its own executable path, since refusals are remembered per path.
    executable_ =
        directory_ + "/" + ::testing::UnitTest::GetInstance()->current_test_info()->name();
    writeFile(executable_, "#!/bin/sh\n", 0755);
    log::setSink(sink_);
  }
  void TearDown() override {
    log::setSink(nullptr);
    std::filesystem::remove_all(directory_);
  }

  std::string entitlementsPath() const { return executable_ + ".entitlements"; }
  void writeEntitlements(const Value& value, mode_t mode = 0644) {
    writeFile(entitlementsPath(), dmapText(value), mode);
  }
  Dictionary read() { return CodeSigning::system()->entitlementsForExecutable(executable_); }
  size_t refusalsLogged() {
    size_t count = 0;
    for (const auto& line : sink_->lines()) {
      if (line.starts_with("ops/error: ignoring entitlements of " + executable_ + ": ")) ++count;
    }
    return count;
  }

  std::string directory_;
  std::string executable_;
  std::shared_ptr<CapturingSink> sink_ = std::make_shared<CapturingSink>();
};

TEST_F(CodeSigningFiles, TrustedFileIsHonoured) {
  writeEntitlements(Value(kEntitlements), 0644);
  EXPECT_EQ(read(), kEntitlements);
  EXPECT_EQ(refusalsLogged(), 0u);
}

TEST_F(CodeSigningFiles, ReadOnlyFileIsHonoured) {
  writeEntitlements(Value(kEntitlements), 0400);
  EXPECT_EQ(read(), kEntitlements);
}

TEST_F(CodeSigningFiles, MissingFileMeansNoneWithoutLog) {
  EXPECT_TRUE(read().empty());
  EXPECT_TRUE(sink_->lines().empty());
}

TEST_F(CodeSigningFiles, WritableByOthersIsRefusedAndLoggedOnce) {
  writeEntitlements(Value(kEntitlements), 0666);
  EXPECT_TRUE(read().empty());
  EXPECT_TRUE(read().empty());
  EXPECT_EQ(refusalsLogged(), 1u);
}

TEST_F(CodeSigningFiles, WritableByGroupIsRefused) {
  writeEntitlements(Value(kEntitlements), 0664);
  EXPECT_TRUE(read().empty());
  EXPECT_EQ(refusalsLogged(), 1u);
}

TEST_F(CodeSigningFiles, WritableExecutableIsRefused) {
  writeEntitlements(Value(kEntitlements), 0644);
  ASSERT_EQ(chmod(executable_.c_str(), 0777), 0);
  EXPECT_TRUE(read().empty());
  EXPECT_EQ(refusalsLogged(), 1u);
}

TEST_F(CodeSigningFiles, SymbolicLinkIsRefused) {
  std::string target = directory_ + "/target.entitlements";
  writeFile(target, dmapText(Value(kEntitlements)), 0644);
  ASSERT_EQ(symlink(target.c_str(), entitlementsPath().c_str()), 0);
  EXPECT_TRUE(read().empty());
  EXPECT_EQ(refusalsLogged(), 1u);
}

TEST_F(CodeSigningFiles, DirectoryIsRefused) {
  ASSERT_EQ(mkdir(entitlementsPath().c_str(), 0755), 0);
  EXPECT_TRUE(read().empty());
  EXPECT_EQ(refusalsLogged(), 1u);
}

TEST_F(CodeSigningFiles, FifoIsRefusedWithoutBlocking) {
  ASSERT_EQ(mkfifo(entitlementsPath().c_str(), 0644), 0);
  EXPECT_TRUE(read().empty());
  EXPECT_EQ(refusalsLogged(), 1u);
}

TEST_F(CodeSigningFiles, FileOfAnotherUserIsRefused) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to give files away";
  writeEntitlements(Value(kEntitlements), 0644);
  ASSERT_EQ(chown(entitlementsPath().c_str(), 65534, 65534), 0);
  EXPECT_TRUE(read().empty());
  EXPECT_EQ(refusalsLogged(), 1u);
}

TEST_F(CodeSigningFiles, ExecutableOfAnotherUserIsRefused) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to give files away";
  writeEntitlements(Value(kEntitlements), 0644);
  ASSERT_EQ(chown(executable_.c_str(), 65534, 65534), 0);
  EXPECT_TRUE(read().empty());
  EXPECT_EQ(refusalsLogged(), 1u);
}

TEST_F(CodeSigningFiles, NotADictionaryIsRefused) {
  writeEntitlements(Value(Array{Value("a")}), 0644);
  EXPECT_TRUE(read().empty());
  EXPECT_EQ(refusalsLogged(), 1u);
}

TEST_F(CodeSigningFiles, MalformedFileIsRefused) {
  writeFile(entitlementsPath(), "<dmap version=\"1.0\"><dict><key>a", 0644);
  EXPECT_TRUE(read().empty());
  EXPECT_EQ(refusalsLogged(), 1u);
}

TEST_F(CodeSigningFiles, OversizedFileIsRefused) {
  writeFile(entitlementsPath(), std::string(2 * 1024 * 1024, ' '), 0644);
  EXPECT_TRUE(read().empty());
  EXPECT_EQ(refusalsLogged(), 1u);
}

TEST_F(CodeSigningFiles, MissingExecutableHasNone) {
  std::filesystem::remove(executable_);
  writeEntitlements(Value(kEntitlements), 0644);
  EXPECT_TRUE(read().empty());
}

// The test binary itself stands in for a client: its entitlements file is placed next to it.
// CTest runs each case in its own process at the same time, so only one case may own that file.
TEST(CodeSigningSelf, TaskAnswersTheProcessEntitlementsAsReadWhenMade) {
  auto path = executablePathForPid(getpid());
  ASSERT_TRUE(path);
  const std::string entitlements = *path + ".entitlements";
  writeFile(entitlements, dmapText(Value(kEntitlements)), 0644);
  auto task = CodeSigning::system()->taskForAuditToken(AuditToken::self());
  std::filesystem::remove(entitlements);
  ASSERT_TRUE(task);
  auto value = task->entitlementValue("com.corvane.ekd.private");
  ASSERT_TRUE(value.ok());
  EXPECT_EQ(*value, std::optional<Value>(Value(true)));
  auto level = task->entitlementValue("com.corvane.ekd.level");
  ASSERT_TRUE(level.ok());
  EXPECT_EQ(*level, std::optional<Value>(Value(3)));
  auto missing = task->entitlementValue("com.corvane.ekd.other");
  ASSERT_TRUE(missing.ok());
  EXPECT_FALSE(missing->has_value());
}

// Runs a copy of sleep from the test's directory and answers its pid once it has exec'd.
pid_t runCopyOfSleep(const std::string& program) {
  std::filesystem::copy_file("/bin/sleep", program,
                             std::filesystem::copy_options::overwrite_existing);
  chmod(program.c_str(), 0755);
  pid_t child = fork();
  if (child == 0) {
    execl(program.c_str(), program.c_str(), "30", static_cast<char*>(nullptr));
    _exit(127);
  }
  for (int i = 0; i < 5000; ++i) {
    if (executablePathForPid(child) == program) return child;
    usleep(1000);
  }
  return child;
}

TEST_F(CodeSigningFiles, RunningProgramIsVouchedForByItsFile) {
  pid_t child = runCopyOfSleep(executable_);
  ASSERT_GT(child, 0);
  writeEntitlements(Value(kEntitlements), 0644);
  AuditToken token;
  token.pid = child;
  auto value =
      CodeSigning::system()->taskForAuditToken(token)->entitlementValue("com.corvane.ekd.private");
  kill(child, SIGKILL);
  waitpid(child, nullptr, 0);
  ASSERT_TRUE(value.ok()) << value.error().message;
  EXPECT_EQ(*value, std::optional<Value>(Value(true)));
}

TEST_F(CodeSigningFiles, ReplacedProgramIsNotVouchedFor) {
  pid_t child = runCopyOfSleep(executable_);
  ASSERT_GT(child, 0);
  // Another file now lies at the path, with trusted entitlements next to it.
  std::filesystem::remove(executable_);
  writeFile(executable_, "#!/bin/sh\n", 0755);
  writeEntitlements(Value(kEntitlements), 0644);
  AuditToken token;
  token.pid = child;
  auto value =
      CodeSigning::system()->taskForAuditToken(token)->entitlementValue("com.corvane.ekd.private");
  kill(child, SIGKILL);
  waitpid(child, nullptr, 0);
  ASSERT_TRUE(value.ok()) << value.error().message;
  EXPECT_FALSE(value->has_value());
  EXPECT_EQ(refusalsLogged(), 1u);
}

TEST(CodeSigningTask, ExitedProcessIsAnError) {
  pid_t child = fork();
  if (child == 0) _exit(0);
  ASSERT_GT(child, 0);
  waitpid(child, nullptr, 0);
  AuditToken token;
  token.pid = child;
  auto task = CodeSigning::system()->taskForAuditToken(token);
  ASSERT_TRUE(task);
  EXPECT_FALSE(task->entitlementValue("anything").ok());
}

TEST(CodeDirectoryHash, IsTheSha256OfTheFile) {
  std::string pattern = (std::filesystem::temp_directory_path() / "ekhash.XXXXXX").string();
  ASSERT_NE(mkdtemp(pattern.data()), nullptr);
  struct Case {
    std::string contents;
    const char* sha256;
  };
  // FIPS 180-2 test vectors; the million-byte one spans many reads.
  const Case cases[] = {
      {"", "e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855"},
      {"abc", "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad"},
      {std::string(1000000, 'a'),
       "cdc76e5c9914fb9281a1c7e284d73e67f1809a48a497200e046d39ccc7112cd0"},
  };
  std::string file = pattern + "/program";
  for (const auto& c : cases) {
    writeFile(file, c.contents, 0755);
    EXPECT_EQ(codeDirectoryHash(file), std::optional<std::string>(c.sha256));
  }
  EXPECT_FALSE(codeDirectoryHash(pattern + "/missing"));
  EXPECT_FALSE(codeDirectoryHash(pattern));
  std::filesystem::remove_all(pattern);
}

TEST(FakeCodeSigning, AnswersWhatWasSet) {
  FakeCodeSigning fake;
  fake.setEntitlements(10, kEntitlements);
  fake.setExecutableEntitlements("/bin/x", Dictionary{{"k", Value("v")}});
  fake.failFor(11);
  AuditToken ten;
  ten.pid = 10;
  AuditToken eleven;
  eleven.pid = 11;
  AuditToken twelve;
  twelve.pid = 12;
  auto value = fake.taskForAuditToken(ten)->entitlementValue("com.corvane.ekd.level");
  ASSERT_TRUE(value.ok());
  EXPECT_EQ(*value, std::optional<Value>(Value(3)));
  EXPECT_FALSE(fake.taskForAuditToken(eleven)->entitlementValue("x").ok());
  auto none = fake.taskForAuditToken(twelve)->entitlementValue("com.corvane.ekd.level");
  ASSERT_TRUE(none.ok());
  EXPECT_FALSE(none->has_value());
  EXPECT_EQ(fake.entitlementsForExecutable("/bin/x"), (Dictionary{{"k", Value("v")}}));
  EXPECT_TRUE(fake.entitlementsForExecutable("/bin/y").empty());
}

}  // namespace
}  // namespace ek
