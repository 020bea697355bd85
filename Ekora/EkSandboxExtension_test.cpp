#include "Ekora/EkSandboxExtension.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/log/Log.h"
#include "platform/log/testing/CapturingSink.h"

namespace ek {
namespace {

using log::testing::CapturingSink;

class EkSandboxExtensionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    log::configure("debug");
    log::setSink(sink_);
    std::string pattern = "/tmp/eksandboxext-XXXXXX";
    ASSERT_NE(mkdtemp(pattern.data()), nullptr);
    char* real = realpath(pattern.c_str(), nullptr);
    directory_ = real;
    free(real);
  }
  void TearDown() override {
    log::setSink(nullptr);
    log::configure("default");
    std::error_code ignored;
    std::filesystem::remove_all(directory_, ignored);
  }

  std::string validToken() {
    Result<std::string> token = issueServiceExtension("com.example.viewer.thumbs", *sandbox_);
    EXPECT_TRUE(token.ok());
    sink_->clear();
    return token.ok() ? *token : std::string();
  }

  std::shared_ptr<CapturingSink> sink_ = std::make_shared<CapturingSink>();
  std::shared_ptr<EkSandbox> sandbox_ =
      std::make_shared<EkSandbox>(EkSandboxMemoryKeySource::random());
  std::string directory_;
};

// A registered bundle and what may have happened to it since: each row issues for the path
// and entry given and names the error, or the subject the token grants.
TEST_F(EkSandboxExtensionTest, BundleExtensionsOnlyForTheRegisteredDirectoryAndInsideIt) {
  namespace fs = std::filesystem;
  const std::string bundle = directory_ + "/B.appex";
  const std::string other = directory_ + "/Other";
  fs::create_directories(bundle + "/Resources");
  fs::create_directories(other);
  fs::create_symlink("Resources", bundle + "/Inside");
  fs::create_symlink(other, bundle + "/Outside");
  fs::create_symlink(other, directory_ + "/Link");
  auto identityOf = [](const std::string& path) {
    struct stat status {};
    EXPECT_EQ(::stat(path.c_str(), &status), 0);
    return EkBundleIdentity{static_cast<uint64_t>(status.st_dev),
                            static_cast<uint64_t>(status.st_ino), path};
  };
  const EkBundleIdentity registered = identityOf(bundle);
  EkBundleIdentity throughLink = identityOf(other);
  throughLink.canonicalPath = directory_ + "/Link";
  struct Row {
    std::string path;
    std::optional<EkBundleIdentity> identity;
    std::string relative;
    int error;            // 0: issued
    std::string subject;  // of the token issued
  };
  const std::vector<Row> rows{
      {bundle, registered, "", 0, bundle},
      {bundle, registered, "Resources", 0, bundle + "/Resources"},
      {bundle, registered, "Inside", 0, bundle + "/Resources"},
      {bundle, registered, "Outside", EPERM, ""},
      {bundle, registered, "../Other", EPERM, ""},
      {bundle, registered, other, EPERM, ""},
      {bundle, registered, "Absent", ENOENT, ""},
      {bundle, std::nullopt, "", ESTALE, ""},
      {other, registered, "", ESTALE, ""},
      {directory_ + "/Link", throughLink, "", ESTALE, ""},
  };
  for (const Row& row : rows) {
    Result<std::string> token =
        issueBundleExtension(row.path, row.identity, row.relative, *sandbox_);
    const std::string name = row.path + " " + row.relative;
    if (row.error != 0) {
      ASSERT_FALSE(token.ok()) << name;
      EXPECT_TRUE(token.error().isPosix(row.error)) << name << ": " << token.error().message;
      continue;
    }
    ASSERT_TRUE(token.ok()) << name << ": " << token.error().message;
    const int64_t handle = sandbox_->consume(*token);
    ASSERT_GT(handle, 0) << name;
    EXPECT_EQ(sandbox_->grant(handle)->subject, row.subject) << name;
    EXPECT_EQ(sandbox_->grant(handle)->flags, sandbox::kCanonicalizeFlag) << name;
  }
}

TEST_F(EkSandboxExtensionTest, IssuingAFileExtensionLogsPathAndToken) {
  std::filesystem::create_directories(directory_ + "/Viewer.app");
  Result<EkFileURL> url = EkFileURL::fromPath(directory_ + "/Viewer.app");
  ASSERT_TRUE(url.ok());
  Result<std::string> token = issueFileExtension(*url, *sandbox_);
  ASSERT_TRUE(token.ok());
  EXPECT_EQ(token->rfind(sandbox::kReadOnlyFileClass, 0), 0u);
  const auto lines = sink_->lines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, log::Level::Debug);
  EXPECT_EQ(lines[0].category, "sandbox");
  EXPECT_EQ(lines[0].message,
            "issued file extension for " + directory_ + "/Viewer.app -> " + *token);
}

TEST_F(EkSandboxExtensionTest, IssuingForAMissingPathAnswersENOENTAndLogsNothing) {
  Result<EkFileURL> url = EkFileURL::fromPath(directory_ + "/Missing.app");
  ASSERT_TRUE(url.ok());
  Result<std::string> token = issueFileExtension(*url, *sandbox_);
  ASSERT_FALSE(token.ok());
  EXPECT_TRUE(token.error().isPosix(ENOENT));
  EXPECT_TRUE(sink_->lines().empty());
}

TEST_F(EkSandboxExtensionTest, IssuingAServiceExtensionUsesThePlugInServiceClass) {
  Result<std::string> token = issueServiceExtension("com.example.viewer.thumbs", *sandbox_);
  ASSERT_TRUE(token.ok());
  EXPECT_EQ(token->rfind("com.corvane.ekora.plugin-service;0;", 0), 0u);
  const auto lines = sink_->lines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].message,
            "issued service extension for com.example.viewer.thumbs -> " + *token);
}

TEST_F(EkSandboxExtensionTest, NewRecordIsNotConsumed) {
  auto extension = EkSandboxExtension::initWithExtension(validToken(), sandbox_);
  EXPECT_EQ(extension->handle(), -1);
  EXPECT_EQ(sandbox_->heldCount(), 0u);
}

TEST_F(EkSandboxExtensionTest, ExpelOnAFreshRecordDoesNothingAndLogsNothing) {
  EkSandboxExtension extension(validToken(), sandbox_);
  extension.expel();
  EXPECT_EQ(extension.handle(), -1);
  EXPECT_TRUE(sink_->lines().empty());
}

TEST_F(EkSandboxExtensionTest, ConsumeTwiceConsumesOnceAndIsSilentTheSecondTime) {
  EkSandboxExtension extension(validToken(), sandbox_);
  extension.consume();
  const int64_t handle = extension.handle();
  ASSERT_GT(handle, 0);
  ASSERT_EQ(sink_->lines().size(), 1u);
  EXPECT_EQ(sink_->lines()[0].message,
            "consuming extension " + extension.token() + " -> " + std::to_string(handle));
  extension.consume();
  EXPECT_EQ(extension.handle(), handle);
  EXPECT_EQ(sandbox_->heldCount(), 1u);
  EXPECT_EQ(sink_->lines().size(), 1u);
}

TEST_F(EkSandboxExtensionTest, FailedConsumeLogsErrnoAndCanBeRetried) {
  std::string token = validToken();
  EkSandboxExtension forged(token.substr(0, token.size() - 1), sandbox_);
  forged.consume();
  EXPECT_EQ(forged.handle(), -1);
  auto lines = sink_->lines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, log::Level::Default);
  EXPECT_EQ(lines[0].message,
            "failed to consume extension " + forged.token() + " - errno=" + std::to_string(EINVAL));
  forged.consume();
  EXPECT_EQ(sink_->lines().size(), 2u);
  EXPECT_EQ(sandbox_->heldCount(), 0u);
}

TEST_F(EkSandboxExtensionTest, ExpelReleasesAndReturnsToNotConsumed) {
  EkSandboxExtension extension(validToken(), sandbox_);
  extension.consume();
  const int64_t handle = extension.handle();
  sink_->clear();
  extension.expel();
  EXPECT_EQ(extension.handle(), -1);
  EXPECT_EQ(sandbox_->heldCount(), 0u);
  ASSERT_EQ(sink_->lines().size(), 1u);
  EXPECT_EQ(sink_->lines()[0].message, "releasing extension " + std::to_string(handle));
  extension.expel();
  EXPECT_EQ(sink_->lines().size(), 1u);
  // Consumable again, with a new handle.
  extension.consume();
  EXPECT_GT(extension.handle(), handle);
}

TEST_F(EkSandboxExtensionTest, FailedReleaseIsLoggedAndLeavesTheRecordNotConsumed) {
  EkSandboxExtension extension(validToken(), sandbox_);
  extension.consume();
  const int64_t handle = extension.handle();
  ASSERT_EQ(sandbox_->release(handle), 0);
  sink_->clear();
  extension.expel();
  EXPECT_EQ(extension.handle(), -1);
  ASSERT_EQ(sink_->lines().size(), 1u);
  EXPECT_EQ(sink_->lines()[0].level, log::Level::Default);
  EXPECT_EQ(sink_->lines()[0].message, "failed to release extension " + std::to_string(handle) +
                                           " - errno=" + std::to_string(EBADF));
}

TEST_F(EkSandboxExtensionTest, DestroyingTheRecordReleasesItsRight) {
  {
    auto extension = EkSandboxExtension::initWithExtension(validToken(), sandbox_);
    extension->consume();
    EXPECT_EQ(sandbox_->heldCount(), 1u);
  }
  EXPECT_EQ(sandbox_->heldCount(), 0u);
}

TEST_F(EkSandboxExtensionTest, RecordsWithEqualTokensAreEqualWhateverTheirState) {
  const std::string token = validToken();
  EkSandboxExtension consumed(token, sandbox_);
  EkSandboxExtension fresh(token, sandbox_);
  EkSandboxExtension other(validToken(), sandbox_);
  consumed.consume();
  EXPECT_TRUE(consumed.isEqual(fresh));
  EXPECT_TRUE(fresh == consumed);
  EXPECT_FALSE(consumed.isEqual(other));
}

}  // namespace
}  // namespace ek
