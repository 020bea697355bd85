#include "platform/privo/Consent.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"

namespace ek::privo {
namespace {

namespace fs = std::filesystem;
using Services = std::vector<std::string>;

class CapturingSink : public log::Sink {
 public:
  void write(const log::Record& record) override {
    std::lock_guard lock(mutex_);
    if (record.level == log::Level::Error) errors_.emplace_back(record.message);
  }
  std::vector<std::string> errors() const {
    std::lock_guard lock(mutex_);
    return errors_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> errors_;
};

class FileConsentTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/privo-test-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    dir_ = pattern;
    sink_ = std::make_shared<CapturingSink>();
    log::setSink(sink_);
    log::configure("info");
  }
  void TearDown() override {
    log::setSink(nullptr);
    log::configure("default");
    fs::remove_all(dir_);
  }

  fs::path file() const { return fs::path(dir_) / "consent.dmap"; }
  void write(const Dictionary& consent) {
    ASSERT_TRUE(dmap::writeFileAtomically(file().string(), Value(consent)).ok());
  }
  void writeBytes(const std::string& bytes) {
    ASSERT_TRUE(dmap::writeBytesAtomically(file().string(), bytes).ok());
  }

  std::string dir_;
  std::shared_ptr<CapturingSink> sink_;
};

TEST_F(FileConsentTest, MissingFileGrantsNothingAndIsNotAnError) {
  FileConsent consent(dir_);
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{});
  EXPECT_TRUE(sink_->errors().empty());
}

TEST_F(FileConsentTest, OnlyBooleanTrueGrants) {
  write(Dictionary{
      {"com.example.app", Value(Dictionary{{"com.corvane.privo.keyboard-network", Value(true)},
                                           {"com.corvane.privo.camera", Value(false)},
                                           {"com.corvane.privo.contacts", Value("true")},
                                           {"com.corvane.privo.photos", Value(1)},
                                           {"com.corvane.privo.location", Value(true)}})},
      {"com.example.other", Value(Dictionary{{"com.corvane.privo.camera", Value(true)}})}});
  FileConsent consent(dir_);
  EXPECT_EQ(consent.grantedServices("com.example.app"),
            (Services{"com.corvane.privo.keyboard-network", "com.corvane.privo.location"}));
  EXPECT_EQ(consent.grantedServices("com.example.other"), Services{"com.corvane.privo.camera"});
  EXPECT_EQ(consent.grantedServices("com.example.unknown"), Services{});
}

TEST_F(FileConsentTest, ApplicationEntryThatIsNotADictionaryGrantsNothing) {
  write(Dictionary{{"com.example.app", Value(true)},
                   {"com.example.other", Value(Dictionary{{"s", Value(true)}})}});
  FileConsent consent(dir_);
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{});
  EXPECT_EQ(consent.grantedServices("com.example.other"), Services{"s"});
  EXPECT_TRUE(sink_->errors().empty());
}

TEST_F(FileConsentTest, ReplacedFileIsReadAgain) {
  write(Dictionary{{"com.example.app", Value(Dictionary{{"a", Value(true)}})}});
  FileConsent consent(dir_);
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{"a"});
  write(
      Dictionary{{"com.example.app", Value(Dictionary{{"a", Value(false)}, {"b", Value(true)}})}});
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{"b"});
  fs::remove(file());
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{});
}

TEST_F(FileConsentTest, FileAppearingLaterIsRead) {
  FileConsent consent(dir_);
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{});
  write(Dictionary{{"com.example.app", Value(Dictionary{{"a", Value(true)}})}});
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{"a"});
}

TEST_F(FileConsentTest, MalformedFileIsLoggedOnceAndGrantsNothing) {
  write(Dictionary{{"com.example.app", Value(Dictionary{{"a", Value(true)}})}});
  FileConsent consent(dir_);
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{"a"});
  writeBytes("<dmap version=\"1.0\"><dict><key>x</key></dmap>");
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{});
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{});
  ASSERT_EQ(sink_->errors().size(), 1u);
  EXPECT_NE(sink_->errors()[0].find(file().string()), std::string::npos);

  write(Dictionary{{"com.example.app", Value(Dictionary{{"b", Value(true)}})}});
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{"b"});
  EXPECT_EQ(sink_->errors().size(), 1u);
}

TEST_F(FileConsentTest, RootThatIsNotADictionaryIsUnusable) {
  write(Dictionary{});
  writeBytes("<?xml version=\"1.0\"?>\n<dmap version=\"1.0\"><array/></dmap>\n");
  FileConsent consent(dir_);
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{});
  EXPECT_EQ(sink_->errors().size(), 1u);
}

TEST_F(FileConsentTest, OversizedFileIsRefusedUnparsed) {
  std::string bytes =
      "<dmap version=\"1.0\"><dict><key>com.example.app</key><dict>"
      "<key>a</key><true/></dict></dict></dmap>";
  bytes.append(kMaxConsentFileSize, ' ');
  writeBytes(bytes);
  FileConsent consent(dir_);
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{});
  EXPECT_EQ(sink_->errors().size(), 1u);
}

TEST_F(FileConsentTest, DirectoryInPlaceOfTheFileIsUnusable) {
  fs::create_directory(file());
  FileConsent consent(dir_);
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{});
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{});
  EXPECT_EQ(sink_->errors().size(), 1u);
}

TEST_F(FileConsentTest, DefaultLocationIsTheStateDirectory) {
  ::setenv("EKORA_STATE_DIR", dir_.c_str(), 1);
  write(Dictionary{{"com.example.app", Value(Dictionary{{"a", Value(true)}})}});
  FileConsent consent;
  EXPECT_EQ(consent.path(), file().string());
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{"a"});
  ::unsetenv("EKORA_STATE_DIR");
}

TEST(FakeConsentTest, AnswersWhatWasGrantedSortedAndRecordsQueries) {
  FakeConsent consent;
  consent.grant("com.example.app", "b");
  consent.grant("com.example.app", "a");
  consent.grant("com.example.app", "b");
  EXPECT_EQ(consent.grantedServices("com.example.app"), (Services{"a", "b"}));
  EXPECT_EQ(consent.grantedServices("com.example.none"), Services{});
  consent.revokeAll("com.example.app");
  EXPECT_EQ(consent.grantedServices("com.example.app"), Services{});
  EXPECT_EQ(consent.queries(),
            (Services{"com.example.app", "com.example.none", "com.example.app"}));
}

}  // namespace
}  // namespace ek::privo
