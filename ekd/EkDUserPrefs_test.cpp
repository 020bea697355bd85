#include "ekd/EkDUserPrefs.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <mutex>
#include <string>
#include <vector>

#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"

namespace ek {
namespace {

namespace fs = std::filesystem;

class CountingSink : public log::Sink {
 public:
  void write(const log::Record& record) override {
    std::lock_guard lock(mutex_);
    if (record.level == log::Level::Error) ++errors_;
  }
  int errors() const {
    std::lock_guard lock(mutex_);
    return errors_;
  }

 private:
  mutable std::mutex mutex_;
  int errors_ = 0;
};

const Value kRules = Array{Dictionary{{"QvBundleIdentifier", "com.example.unwanted"}}};

class EkDUserPrefsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "ekora-userprefs-XXXXXX").string();
    ASSERT_NE(mkdtemp(pattern.data()), nullptr);
    state_ = pattern;
    setenv("EKORA_STATE_DIR", state_.c_str(), 1);
    log::setSink(sink_);
  }
  void TearDown() override {
    log::setSink(nullptr);
    unsetenv("EKORA_STATE_DIR");
    std::error_code ignored;
    fs::remove_all(state_, ignored);
  }

  fs::path file() const {
    return state_ / "preferences" / std::to_string(geteuid()) /
           (std::string(EkDUserPrefs::kDomain) + ".dmap");
  }
  void writeFile(std::string_view bytes) const {
    fs::create_directories(file().parent_path());
    std::ofstream out(file(), std::ios::binary | std::ios::trunc);
    out << bytes;
  }

  fs::path state_;
  std::shared_ptr<CountingSink> sink_ = std::make_shared<CountingSink>();
};

TEST_F(EkDUserPrefsTest, NoDomainOrKeyYieldsNothing) {
  auto userPrefs = EkDUserPrefs::init();
  EXPECT_FALSE(userPrefs->exclusions());
  writeFile(dmap::write(Value(Dictionary{{"other", 1}})).value());
  EXPECT_FALSE(userPrefs->exclusions());
  EXPECT_EQ(sink_->errors(), 0);
}

TEST_F(EkDUserPrefsTest, AnotherWritersValueIsSeenByTheNextCall) {
  auto userPrefs = EkDUserPrefs::init();
  EXPECT_FALSE(userPrefs->exclusions());

  auto writer = prefs::PreferencesDomain::open(EkDUserPrefs::kDomain);
  ASSERT_TRUE(writer.ok());
  ASSERT_TRUE((*writer)->set(EkDUserPrefs::kExclusionsKey, kRules).ok());
  EXPECT_EQ(userPrefs->exclusions(), kRules);

  ASSERT_TRUE((*writer)->remove(EkDUserPrefs::kExclusionsKey).ok());
  EXPECT_FALSE(userPrefs->exclusions());
}

TEST_F(EkDUserPrefsTest, FileWrittenDirectlyIsSeenByTheNextCall) {
  auto userPrefs = EkDUserPrefs::init();
  writeFile(dmap::write(Value(Dictionary{{"exclusions", Array{}}})).value());
  EXPECT_EQ(userPrefs->exclusions(), Value(Array{}));
  writeFile(dmap::write(Value(Dictionary{{"exclusions", kRules}})).value());
  EXPECT_EQ(userPrefs->exclusions(), kRules);
}

TEST_F(EkDUserPrefsTest, ValueOfAnyTypeIsPassedOnUnchanged) {
  writeFile(dmap::write(Value(Dictionary{{"exclusions", "not a list"}})).value());
  EXPECT_EQ(EkDUserPrefs::init()->exclusions(), Value("not a list"));
}

TEST_F(EkDUserPrefsTest, FileThatIsNotDmapYieldsNothingAndOneLogLine) {
  writeFile("exclusions = everything");
  auto userPrefs = EkDUserPrefs::init();
  EXPECT_FALSE(userPrefs->exclusions());
  EXPECT_FALSE(userPrefs->exclusions());
  EXPECT_EQ(sink_->errors(), 1);
}

TEST_F(EkDUserPrefsTest, RootThatIsNotADictionaryYieldsNothing) {
  writeFile(dmap::write(Value(Array{Dictionary{{"exclusions", kRules}}})).value());
  EXPECT_FALSE(EkDUserPrefs::init()->exclusions());
}

TEST_F(EkDUserPrefsTest, ReadsTheUserPrefsDomainOfTheGivenPreferences) {
  auto fake = std::make_shared<prefs::FakePreferences>();
  auto userPrefs = EkDUserPrefs::init(fake);
  fake->set("com.corvane.ekora.other", "exclusions", kRules);
  fake->set("com.corvane.ekora.userprefs", "exclusion", kRules);
  EXPECT_FALSE(userPrefs->exclusions());
  fake->set("com.corvane.ekora.userprefs", "exclusions", kRules);
  EXPECT_EQ(userPrefs->exclusions(), kRules);
}

}  // namespace
}  // namespace ek
