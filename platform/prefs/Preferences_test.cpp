#include "platform/prefs/Preferences.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <cmath>
#include <filesystem>
#include <fstream>
#include <thread>

#include "platform/dmap/Dmap.h"
#include "platform/log/testing/CapturingSink.h"
#include "platform/testing/Files.h"

namespace ek::prefs {
namespace {

constexpr std::string_view kDomain = "com.example.settings";
constexpr uid_t kUid = 501;

class PreferencesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    setenv("EKORA_STATE_DIR", state_.path().c_str(), 1);
    log::setSink(sink_);
  }
  void TearDown() override {
    log::setSink(nullptr);
    unsetenv("EKORA_STATE_DIR");
  }

  std::unique_ptr<PreferencesDomain> open() {
    return PreferencesDomain::open(kDomain, kUid).value();
  }
  std::string bytes() const {
    std::ifstream in(file_);
    return std::string(std::istreambuf_iterator<char>(in), {});
  }
  Dictionary contents() const { return *dmap::readFile(file_).value().dictionary(); }
  int errorsLogged() const {
    return sink_->countIf([](const auto& line) { return line.level == log::Level::Error; });
  }

  testing::TempDir state_;
  const std::string file_ = state_.file("preferences/501/com.example.settings.dmap");
  std::shared_ptr<log::testing::CapturingSink> sink_ =
      std::make_shared<log::testing::CapturingSink>();
};

TEST_F(PreferencesTest, WritersKeepWhatOthersWroteAndReadersSeeItOnceSynchronised) {
  auto reader = open();
  auto writer = open();
  reader->synchronize();
  EXPECT_FALSE(reader->exists());
  ASSERT_TRUE(reader->remove("a").ok());  // nothing to remove: no file is made
  EXPECT_FALSE(std::filesystem::exists(file_));
  ASSERT_TRUE(writer->set("a", 1).ok());
  EXPECT_FALSE(reader->value("a"));                // nothing is read until asked to synchronise
  ASSERT_TRUE(reader->set("b", Array{"x"}).ok());  // keeps "a", which it has not read
  ASSERT_TRUE(writer->set("c", 3).ok());
  EXPECT_EQ(contents(), (Dictionary{{"a", 1}, {"b", Array{"x"}}, {"c", 3}}));
  reader->synchronize();
  EXPECT_EQ(reader->dictionary(), contents());
  ASSERT_TRUE(writer->remove("a").ok());
  reader->synchronize();
  EXPECT_FALSE(reader->value("a"));
  ASSERT_TRUE(testing::writeFile(file_, dmap::write(Value(Dictionary{{"k", "v"}})).value()));
  reader->synchronize();  // a file rewritten in place by hand
  EXPECT_EQ(reader->value("k"), Value("v"));
  ASSERT_TRUE(writer->removeAll().ok());
  EXPECT_TRUE(contents().empty());
  struct stat st {};
  ASSERT_EQ(stat(file_.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
}

TEST_F(PreferencesTest, ConcurrentWritersLoseNoKey) {
  std::vector<std::jthread> threads;
  for (int w = 0; w < 4; ++w) {
    threads.emplace_back([w] {
      auto domain = PreferencesDomain::open(kDomain, kUid).value();
      for (int k = 0; k < 10; ++k) EXPECT_TRUE(domain->set(std::to_string(w * 10 + k), k).ok());
    });
  }
  threads.clear();
  EXPECT_EQ(contents().size(), 40u);
}

TEST_F(PreferencesTest, UnreadableFileIsEmptyLoggedOncePerVersionAndReplacedByAWrite) {
  ASSERT_TRUE(testing::writeFile(file_, "not xml at all"));
  auto domain = open();
  domain->synchronize();
  EXPECT_TRUE(domain->exists());
  EXPECT_TRUE(domain->dictionary().empty());
  EXPECT_EQ(domain->readError()->domain, kFormatErrorDomain);
  ASSERT_TRUE(testing::writeFile(file_, dmap::write(Value(Array{"a", "b"})).value()));
  domain->synchronize();
  domain->synchronize();
  EXPECT_TRUE(domain->readError());
  EXPECT_EQ(errorsLogged(), 2);
  ASSERT_TRUE(domain->set("k", "v").ok());
  EXPECT_EQ(contents(), (Dictionary{{"k", "v"}}));
  EXPECT_FALSE(domain->readError());
  EXPECT_EQ(errorsLogged(), 2);
  // A value the file cannot carry changes nothing.
  const std::string before = bytes();
  EXPECT_EQ(domain->set("bad", std::nan("")).error().domain, kFormatErrorDomain);
  EXPECT_EQ(bytes(), before);
  EXPECT_FALSE(domain->value("bad"));
}

TEST_F(PreferencesTest, DomainNameMustBeOnePathComponent) {
  const std::pair<std::string, bool> cases[] = {
      {"com.corvane.ekora.userprefs", true},
      {".hidden", true},
      {std::string(kMaxDomainNameLength, 'a'), true},
      {std::string(kMaxDomainNameLength + 1, 'a'), false},
      {"", false},
      {".", false},
      {"..", false},
      {"../escape", false},
      {std::string("nul\0byte", 8), false},
  };
  for (const auto& [name, valid] : cases) {
    auto opened = PreferencesDomain::open(name, kUid);
    EXPECT_TRUE(valid ? opened.ok() : opened.error().isPosix(EINVAL)) << name;
  }
}

TEST_F(PreferencesTest, FilePreferencesAnswersEachChange) {
  FilePreferences preferences(kUid);
  auto writer = open();
  for (const char* value : {"one", "two"}) {
    ASSERT_TRUE(writer->set("k", value).ok());
    EXPECT_EQ(preferences.value(kDomain, "k"), Value(value));
  }
  EXPECT_FALSE(preferences.value("other.domain", "k"));
  EXPECT_FALSE(preferences.value("../x", "k"));
  ASSERT_TRUE(PreferencesDomain::open(kDomain).value()->set("mine", true).ok());
  EXPECT_EQ(FilePreferences().value(kDomain, "mine"), Value(true));
}

}  // namespace
}  // namespace ek::prefs
