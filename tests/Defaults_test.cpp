// ekctl defaults edits the current user's preferences domains directly: no daemon needed, only
// the state directory.
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "platform/dmap/Dmap.h"
#include "platform/json/WireJson.h"
#include "tests/EkdProcess.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;

constexpr std::string_view kDomain = "com.corvane.ekora.userprefs";

class DefaultsTest : public ::testing::Test {
 protected:
  CommandResult ekctl(std::vector<std::string> args) const {
    args.insert(args.begin(), ekctlPath());
    return runCommand(args, {{"EKORA_STATE_DIR", state().string()}});
  }
  fs::path state() const { return root_.path() / "state"; }
  fs::path file(std::string_view domain = kDomain) const {
    return state() / "preferences" / std::to_string(geteuid()) / (std::string(domain) + ".dmap");
  }
  // The value ekctl printed, parsed back from wire JSON.
  static Value printed(const CommandResult& result) {
    auto value = wirejson::parse(result.out);
    EXPECT_TRUE(value.ok()) << result.out;
    return value ? *value : Value();
  }

  TempDir root_;
};

TEST_F(DefaultsTest, WriteReadDeleteRoundTrip) {
  const std::string rules = R"([{"QvBundleIdentifier": "com.example.unwanted"}])";
  auto written = ekctl({"defaults", "write", std::string(kDomain), "exclusions", rules});
  ASSERT_EQ(written.status, 0) << written.err;
  ASSERT_EQ(ekctl({"defaults", "write", std::string(kDomain), "level", "3"}).status, 0);

  auto one = ekctl({"defaults", "read", std::string(kDomain), "exclusions"});
  ASSERT_EQ(one.status, 0) << one.err;
  EXPECT_EQ(printed(one), wirejson::parse(rules).value());

  auto all = ekctl({"defaults", "read", std::string(kDomain)});
  ASSERT_EQ(all.status, 0) << all.err;
  EXPECT_EQ(printed(all),
            Value(Dictionary{{"exclusions", wirejson::parse(rules).value()}, {"level", 3}}));

  ASSERT_EQ(ekctl({"defaults", "delete", std::string(kDomain), "exclusions"}).status, 0);
  auto gone = ekctl({"defaults", "read", std::string(kDomain), "exclusions"});
  EXPECT_EQ(gone.status, 1);
  EXPECT_EQ(gone.err.rfind("ekctl: ", 0), 0u) << gone.err;
  EXPECT_EQ(printed(ekctl({"defaults", "read", std::string(kDomain)})),
            Value(Dictionary{{"level", 3}}));
}

TEST_F(DefaultsTest, DomainFileIsDmapUnderTheUsersPreferences) {
  ASSERT_EQ(
      ekctl({"defaults", "write", std::string(kDomain), "blob", R"({"$data": "AAEC"})"}).status, 0);
  ASSERT_EQ(ekctl({"defaults", "write", std::string(kDomain), "name", R"("viewer")"}).status, 0);
  ASSERT_TRUE(fs::is_regular_file(file()));
  auto contents = dmap::readFile(file().string());
  ASSERT_TRUE(contents.ok()) << contents.error().message;
  EXPECT_EQ(*contents, Value(Dictionary{{"blob", Data{0, 1, 2}}, {"name", "viewer"}}));
  EXPECT_EQ(fs::status(file()).permissions(), fs::perms::owner_read | fs::perms::owner_write |
                                                  fs::perms::group_read | fs::perms::others_read);
}

TEST_F(DefaultsTest, ReadOfMissingDomainOrKeyExitsOne) {
  auto domain = ekctl({"defaults", "read", "com.example.absent"});
  EXPECT_EQ(domain.status, 1);
  EXPECT_EQ(domain.err.rfind("ekctl: ", 0), 0u) << domain.err;
  EXPECT_TRUE(domain.out.empty());

  ASSERT_EQ(ekctl({"defaults", "write", std::string(kDomain), "a", "1"}).status, 0);
  auto key = ekctl({"defaults", "read", std::string(kDomain), "b"});
  EXPECT_EQ(key.status, 1);
  EXPECT_NE(key.err.find("\"b\""), std::string::npos) << key.err;
  EXPECT_EQ(ekctl({"defaults", "delete", std::string(kDomain), "b"}).status, 1);
  EXPECT_EQ(ekctl({"defaults", "delete", "com.example.absent"}).status, 1);
}

TEST_F(DefaultsTest, DeleteOfADomainEmptiesIt) {
  ASSERT_EQ(ekctl({"defaults", "write", std::string(kDomain), "a", "1"}).status, 0);
  ASSERT_EQ(ekctl({"defaults", "delete", std::string(kDomain)}).status, 0);
  auto all = ekctl({"defaults", "read", std::string(kDomain)});
  ASSERT_EQ(all.status, 0) << all.err;
  EXPECT_EQ(printed(all), Value(Dictionary{}));
}

TEST_F(DefaultsTest, UnreadableDomainFailsToReadAndIsReplacedByAWrite) {
  fs::create_directories(file().parent_path());
  std::ofstream(file()) << "not a preferences file";
  EXPECT_EQ(ekctl({"defaults", "read", std::string(kDomain)}).status, 1);
  ASSERT_EQ(ekctl({"defaults", "write", std::string(kDomain), "a", "true"}).status, 0);
  auto contents = dmap::readFile(file().string());
  ASSERT_TRUE(contents.ok());
  EXPECT_EQ(*contents, Value(Dictionary{{"a", true}}));
}

TEST_F(DefaultsTest, UsageErrorsExitTwoAndTouchNothing) {
  const std::vector<std::vector<std::string>> cases = {
      {"defaults"},
      {"defaults", "read"},
      {"defaults", "rename", std::string(kDomain)},
      {"defaults", "write", std::string(kDomain), "key"},
      {"defaults", "write", std::string(kDomain), "key", "{not json"},
      {"defaults", "write", std::string(kDomain), "key", "null"},
      {"defaults", "write", "../escape", "key", "1"},
      {"defaults", "write", "a/b", "key", "1"},
      {"defaults", "write", "", "key", "1"},
      {"defaults", "read", ".."},
      {"defaults", "delete", std::string(201, 'd')},
  };
  for (const auto& args : cases) {
    SCOPED_TRACE(testing::PrintToString(args));
    auto result = ekctl(args);
    EXPECT_EQ(result.status, 2) << result.err;
    EXPECT_FALSE(result.err.empty());
  }
  EXPECT_FALSE(fs::exists(state() / "preferences"));
  EXPECT_FALSE(fs::exists(root_.path() / "escape.dmap"));
}

}  // namespace
}  // namespace ek::test
