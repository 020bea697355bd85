#include "Ekora/EkSandboxExtension.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "platform/log/Log.h"
#include "platform/log/testing/CapturingSink.h"
#include "platform/testing/Files.h"

namespace ek {
namespace {

namespace fs = std::filesystem;

class EkSandboxExtensionTest : public ::testing::Test {
 protected:
  void SetUp() override { log::setSink(sink_); }
  void TearDown() override { log::setSink(nullptr); }

  std::shared_ptr<log::testing::CapturingSink> sink_ =
      std::make_shared<log::testing::CapturingSink>();
  std::shared_ptr<EkSandbox> sandbox_ =
      std::make_shared<EkSandbox>(EkSandboxMemoryKeySource::random());
  testing::TempDir temp_;
  const std::string dir_ = fs::canonical(temp_.path()).string();
};

// A registered bundle and what may have happened to it since: each row issues for the path
// and entry given and names the error, or the subject the token grants.
TEST_F(EkSandboxExtensionTest, BundleExtensionsOnlyForTheRegisteredDirectoryAndInsideIt) {
  const std::string bundle = dir_ + "/B.appex";
  const std::string other = dir_ + "/Other";
  fs::create_directories(bundle + "/Resources");
  fs::create_directories(other);
  fs::create_directories(dir_ + "/B.appex2");
  fs::create_symlink("Resources", bundle + "/Inside");
  fs::create_symlink(other, bundle + "/Outside");
  fs::create_symlink(other, dir_ + "/Link");
  auto identityOf = [](const std::string& path) {
    struct stat status {};
    EXPECT_EQ(::stat(path.c_str(), &status), 0);
    return EkBundleIdentity{status.st_dev, status.st_ino, path};
  };
  const EkBundleIdentity registered = identityOf(bundle);
  EkBundleIdentity throughLink = identityOf(other);
  throughLink.canonicalPath = dir_ + "/Link";
  const struct {
    std::string path;
    std::optional<EkBundleIdentity> identity;
    std::string relative;
    int error;            // 0: issued
    std::string subject;  // of the token issued
  } rows[] = {
      {bundle, registered, "", 0, bundle},
      {bundle, registered, "Inside", 0, bundle + "/Resources"},
      {bundle, registered, "Outside", EPERM, ""},
      {bundle, registered, "../B.appex2", EPERM, ""},
      {bundle, registered, "Absent", ENOENT, ""},
      {bundle, std::nullopt, "", ESTALE, ""},
      {other, registered, "", ESTALE, ""},
      {dir_ + "/Link", throughLink, "", ESTALE, ""},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.path + " " + row.relative);
    Result<std::string> token =
        issueBundleExtension(row.path, row.identity, row.relative, *sandbox_);
    if (row.error != 0) {
      ASSERT_FALSE(token.ok());
      EXPECT_TRUE(token.error().isPosix(row.error)) << token.error().message;
      continue;
    }
    ASSERT_TRUE(token.ok()) << token.error().message;
    const int64_t handle = sandbox_->consume(*token);
    ASSERT_GT(handle, 0);
    EXPECT_EQ(sandbox_->grant(handle)->subject, row.subject);
    EXPECT_EQ(sandbox_->grant(handle)->flags, sandbox::kCanonicalizeFlag);
  }
}

// A record holds at most one right, gives it back when expelled or destroyed, and logs the
// failures of either step, after which it is not consumed.
TEST_F(EkSandboxExtensionTest, RecordHoldsAtMostOneRightAndLogsWhatFails) {
  const std::string token = issueServiceExtension("com.example.thumbs", *sandbox_).value();
  auto extension = EkSandboxExtension::initWithExtension(token, sandbox_);
  extension->consume();
  extension->consume();
  EXPECT_EQ(sandbox_->heldCount(), 1u);
  extension->expel();
  EXPECT_EQ(extension->handle(), EkSandboxExtension::kNotConsumed);
  EXPECT_EQ(sandbox_->heldCount(), 0u);
  extension->consume();
  const int64_t handle = extension->handle();
  ASSERT_EQ(sandbox_->release(handle), 0);
  extension->consume();
  extension->expel();
  EXPECT_EQ(extension->handle(), EkSandboxExtension::kNotConsumed);
  EXPECT_TRUE(sink_->has(log::Level::Default, "sandbox",
                         "failed to release extension " + std::to_string(handle) + " - errno=9"));
  extension->consume();
  extension.reset();
  EXPECT_EQ(sandbox_->heldCount(), 0u);
  EkSandboxExtension forged(token.substr(1), sandbox_);
  forged.consume();
  EXPECT_EQ(forged.handle(), EkSandboxExtension::kNotConsumed);
  EXPECT_TRUE(sink_->has(log::Level::Default, "sandbox",
                         "failed to consume extension " + forged.token() + " - errno=22"));
}

}  // namespace
}  // namespace ek
