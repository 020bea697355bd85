#include "ekd/EkDUserPrefs.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <unistd.h>

#include "platform/dmap/Dmap.h"
#include "platform/testing/Files.h"

namespace ek {
namespace {

const Value kRules = Array{Dictionary{{"QvBundleIdentifier", "com.example.unwanted"}}};

TEST(EkDUserPrefsTest, ExclusionsAreTheDomainsValueAsTheFileHoldsItNow) {
  testing::TempDir state;
  setenv("EKORA_STATE_DIR", state.path().c_str(), 1);
  const std::string file = state.file("preferences/" + std::to_string(geteuid()) + "/" +
                                      std::string(EkDUserPrefs::kDomain) + ".dmap");
  auto userPrefs = EkDUserPrefs::init();
  EXPECT_FALSE(userPrefs->exclusions());
  struct Row {
    std::string bytes;
    std::optional<Value> exclusions;
  };
  const Row rows[] = {
      {dmap::write(Value(Dictionary{{"exclusions", kRules}})).value(), kRules},
      {dmap::write(Value(Dictionary{{"exclusions", "not a list"}})).value(), Value("not a list")},
      {dmap::write(Value(Dictionary{{"other", 1}})).value(), std::nullopt},
      {dmap::write(Value(Array{Dictionary{{"exclusions", kRules}}})).value(), std::nullopt},
      {"exclusions = everything", std::nullopt},
  };
  for (const Row& row : rows) {
    ASSERT_TRUE(testing::writeFile(file, row.bytes));
    EXPECT_EQ(userPrefs->exclusions(), row.exclusions) << row.bytes;
  }
  unsetenv("EKORA_STATE_DIR");
}

TEST(EkDUserPrefsTest, ReadsTheUserPrefsDomainOfTheGivenPreferences) {
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
