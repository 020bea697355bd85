#include "platform/prefs/Preferences.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <cmath>
#include <filesystem>
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
  void SetUp() override { setenv("EKORA_STATE_DIR", state_.path().c_str(), 1); }
  void TearDown() override { unsetenv("EKORA_STATE_DIR"); }

  std::unique_ptr<PreferencesDomain> open() {
    return PreferencesDomain::open(kDomain, kUid).value();
  }
  Dictionary contents() const { return *dmap::readFile(file_).value().dictionary(); }

  testing::TempDir state_;
  const std::string file_ = state_.file("preferences/501/com.example.settings.dmap");
};

TEST_F(PreferencesTest, WritersKeepWhatOthersWroteAndReadersSeeItOnceSynchronised) {
  auto reader = open();
  auto writer = open();
  FilePreferences preferences(kUid);
  ASSERT_TRUE(reader->remove("a").ok());  // nothing to remove: no file is made
  EXPECT_FALSE(std::filesystem::exists(file_));
  ASSERT_TRUE(writer->set("a", 1).ok());
  EXPECT_FALSE(reader->value("a"));  // nothing is read until asked to synchronise
  EXPECT_EQ(preferences.value(kDomain, "a"), Value(1));
  ASSERT_TRUE(reader->set("b", Array{"x"}).ok());  // keeps "a", which it has not read
  ASSERT_TRUE(writer->set("a", 3).ok());
  EXPECT_EQ(contents(), (Dictionary{{"a", 3}, {"b", Array{"x"}}}));
  EXPECT_EQ(preferences.value(kDomain, "a"), Value(3));
  ASSERT_TRUE(testing::writeFile(file_, dmap::write(Value(Dictionary{{"k", "v"}})).value()));
  reader->synchronize();  // a file rewritten in place by hand
  EXPECT_EQ(reader->dictionary(), (Dictionary{{"k", "v"}}));
  ASSERT_TRUE(writer->removeAll().ok());
  EXPECT_TRUE(contents().empty());
  struct stat st {};
  ASSERT_EQ(stat(file_.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
  EXPECT_FALSE(preferences.value("../x", "k"));
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
  auto sink = std::make_shared<log::testing::CapturingSink>();
  log::setSink(sink);
  ASSERT_TRUE(testing::writeFile(file_, "not xml at all"));
  auto domain = open();
  domain->synchronize();
  EXPECT_TRUE(domain->exists() && domain->dictionary().empty());
  ASSERT_TRUE(testing::writeFile(file_, dmap::write(Value(Array{"a", "b"})).value()));
  domain->synchronize();
  domain->synchronize();
  EXPECT_EQ(domain->readError()->domain, kFormatErrorDomain);
  ASSERT_TRUE(domain->set("k", "v").ok());
  EXPECT_EQ(contents(), (Dictionary{{"k", "v"}}));
  EXPECT_FALSE(domain->readError());
  EXPECT_EQ(sink->lines().size(), 2u);
  log::setSink(nullptr);
  // A value the file cannot carry changes nothing.
  EXPECT_EQ(domain->set("bad", std::nan("")).error().domain, kFormatErrorDomain);
  EXPECT_EQ(contents(), (Dictionary{{"k", "v"}}));
  for (const std::string& name : {std::string(), std::string(".."), std::string("../escape"),
                                  std::string(kMaxDomainNameLength + 1, 'a')}) {
    EXPECT_TRUE(PreferencesDomain::open(name, kUid).error().isPosix(EINVAL)) << name;
  }
  EXPECT_TRUE(PreferencesDomain::open(std::string(kMaxDomainNameLength, 'a'), kUid).ok());
}

}  // namespace
}  // namespace ek::prefs
