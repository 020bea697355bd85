#include "platform/prefs/Preferences.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cmath>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"

namespace ek::prefs {
namespace {

namespace fs = std::filesystem;

constexpr std::string_view kDomain = "com.example.settings";
constexpr uid_t kUid = 501;

class CapturingSink : public log::Sink {
 public:
  void write(const log::Record& record) override {
    std::lock_guard lock(mutex_);
    if (record.level == log::Level::Error && record.category == "ops") {
      errors_.emplace_back(record.message);
    }
  }
  std::vector<std::string> errors() const {
    std::lock_guard lock(mutex_);
    return errors_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> errors_;
};

std::string readBytes(const fs::path& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

void writeBytes(const fs::path& path, std::string_view bytes) {
  fs::create_directories(path.parent_path());
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << bytes;
}

class PreferencesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "ekora-prefs-XXXXXX").string();
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

  fs::path file(std::string_view domain = kDomain, uid_t uid = kUid) const {
    return state_ / "preferences" / std::to_string(uid) / (std::string(domain) + ".dmap");
  }

  std::unique_ptr<PreferencesDomain> open(std::string_view domain = kDomain) {
    auto opened = PreferencesDomain::open(domain, kUid);
    EXPECT_TRUE(opened.ok());
    return opened ? std::move(opened).value() : nullptr;
  }

  Dictionary fileContents() const {
    auto value = dmap::readFile(file().string());
    EXPECT_TRUE(value.ok()) << (value ? "" : value.error().message);
    if (!value || !value->dictionary()) return {};
    return *value->dictionary();
  }

  fs::path state_;
  std::shared_ptr<CapturingSink> sink_ = std::make_shared<CapturingSink>();
};

TEST_F(PreferencesTest, DomainFileLivesInTheUsersPreferencesDirectory) {
  auto domain = open();
  EXPECT_EQ(domain->path(), file().string());
  EXPECT_EQ(domainPath("a.b", 0), (state_ / "preferences" / "0" / "a.b.dmap").string());
}

TEST_F(PreferencesTest, MissingFileIsAnEmptyDomainSilently) {
  auto domain = open();
  domain->synchronize();
  EXPECT_FALSE(domain->exists());
  EXPECT_FALSE(domain->value("anything"));
  EXPECT_TRUE(domain->dictionary().empty());
  EXPECT_FALSE(domain->readError());
  EXPECT_TRUE(sink_->errors().empty());
  EXPECT_FALSE(fs::exists(file().parent_path()));
}

TEST_F(PreferencesTest, SetWritesADmapDictionaryWithPlainModes) {
  auto domain = open();
  Value list = Array{Dictionary{{"QvBundleIdentifier", "com.example.viewer"}}};
  ASSERT_TRUE(domain->set("exclusions", list).ok());
  ASSERT_TRUE(domain->set("count", 3).ok());

  EXPECT_EQ(fileContents(), (Dictionary{{"exclusions", list}, {"count", 3}}));
  EXPECT_EQ(domain->value("exclusions"), list);
  EXPECT_TRUE(domain->exists());
  struct stat status {};
  ASSERT_EQ(stat(file().c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0644u);
  ASSERT_EQ(stat(file().parent_path().c_str(), &status), 0);
  EXPECT_TRUE(S_ISDIR(status.st_mode));
}

TEST_F(PreferencesTest, AnotherWritersValueIsSeenAfterSynchronize) {
  auto reader = open();
  auto writer = open();
  ASSERT_TRUE(writer->set("key", "first").ok());
  EXPECT_FALSE(reader->value("key"));  // nothing is read until asked to synchronise
  reader->synchronize();
  EXPECT_EQ(reader->value("key"), Value("first"));

  ASSERT_TRUE(writer->set("key", "second value").ok());
  reader->synchronize();
  EXPECT_EQ(reader->value("key"), Value("second value"));

  ASSERT_TRUE(writer->remove("key").ok());
  reader->synchronize();
  EXPECT_FALSE(reader->value("key"));
}

TEST_F(PreferencesTest, FileWrittenDirectlyIsSeenAfterSynchronize) {
  auto reader = open();
  writeBytes(file(), dmap::write(Value(Dictionary{{"k", 1}})).value());
  reader->synchronize();
  EXPECT_EQ(reader->value("k"), Value(1));
  // Rewritten in place: same inode, another size.
  writeBytes(file(), dmap::write(Value(Dictionary{{"k", 1}, {"other", "x"}})).value());
  reader->synchronize();
  EXPECT_EQ(reader->value("other"), Value("x"));
  fs::remove(file());
  reader->synchronize();
  EXPECT_FALSE(reader->exists());
  EXPECT_FALSE(reader->value("k"));
}

TEST_F(PreferencesTest, WritersKeepKeysOthersSetMeanwhile) {
  auto first = open();
  auto second = open();
  ASSERT_TRUE(first->set("a", 1).ok());
  // second has not synchronised since first wrote; its write must not drop "a".
  ASSERT_TRUE(second->set("b", 2).ok());
  ASSERT_TRUE(first->set("c", 3).ok());
  EXPECT_EQ(fileContents(), (Dictionary{{"a", 1}, {"b", 2}, {"c", 3}}));
  EXPECT_EQ(first->dictionary(), fileContents());
}

TEST_F(PreferencesTest, ConcurrentWritersLoseNoKey) {
  constexpr int kWriters = 4;
  constexpr int kKeysEach = 15;
  std::vector<std::thread> threads;
  for (int w = 0; w < kWriters; ++w) {
    threads.emplace_back([&, w] {
      auto domain = PreferencesDomain::open(kDomain, kUid);
      ASSERT_TRUE(domain.ok());
      for (int k = 0; k < kKeysEach; ++k) {
        ASSERT_TRUE((*domain)->set("w" + std::to_string(w) + "k" + std::to_string(k), k).ok());
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(fileContents().size(), static_cast<size_t>(kWriters * kKeysEach));
}

TEST_F(PreferencesTest, OneDomainIsSafeToShareBetweenThreads) {
  auto domain = open();
  std::thread writer([&] {
    for (int i = 0; i < 50; ++i) ASSERT_TRUE(domain->set("n", i).ok());
  });
  int lastSeen = -1;
  for (int i = 0; i < 200; ++i) {
    domain->synchronize();
    if (auto value = domain->value("n")) {
      ASSERT_NE(value->unsignedNumber(), nullptr);
      int seen = static_cast<int>(*value->unsignedNumber());
      EXPECT_GE(seen, lastSeen);
      lastSeen = seen;
    }
  }
  writer.join();
  domain->synchronize();
  EXPECT_EQ(domain->value("n"), Value(49));
}

TEST_F(PreferencesTest, RemoveAndRemoveAll) {
  auto domain = open();
  ASSERT_TRUE(domain->set("a", 1).ok());
  ASSERT_TRUE(domain->set("b", 2).ok());
  ASSERT_TRUE(domain->remove("a").ok());
  EXPECT_EQ(fileContents(), (Dictionary{{"b", 2}}));
  ASSERT_TRUE(domain->remove("not there").ok());
  EXPECT_EQ(fileContents(), (Dictionary{{"b", 2}}));
  ASSERT_TRUE(domain->removeAll().ok());
  EXPECT_TRUE(fs::exists(file()));
  EXPECT_TRUE(fileContents().empty());
  EXPECT_TRUE(domain->dictionary().empty());
}

TEST_F(PreferencesTest, RemovingFromAMissingDomainCreatesNoFile) {
  auto domain = open();
  ASSERT_TRUE(domain->remove("a").ok());
  ASSERT_TRUE(domain->removeAll().ok());
  EXPECT_FALSE(fs::exists(file()));
}

TEST_F(PreferencesTest, FileThatIsNotDmapIsEmptyAndLoggedOncePerChange) {
  writeBytes(file(), "not xml at all");
  auto domain = open();
  domain->synchronize();
  domain->synchronize();
  EXPECT_TRUE(domain->exists());
  EXPECT_FALSE(domain->value("a"));
  ASSERT_TRUE(domain->readError());
  EXPECT_EQ(domain->readError()->domain, kFormatErrorDomain);
  ASSERT_EQ(sink_->errors().size(), 1u);
  EXPECT_NE(sink_->errors()[0].find(file().string()), std::string::npos);

  writeBytes(file(), "still not xml, and longer");
  domain->synchronize();
  domain->synchronize();
  EXPECT_EQ(sink_->errors().size(), 2u);
}

TEST_F(PreferencesTest, RootThatIsNotADictionaryIsEmpty) {
  writeBytes(file(), dmap::write(Value(Array{"a", "b"})).value());
  auto domain = open();
  EXPECT_TRUE(domain->dictionary().empty());
  ASSERT_TRUE(domain->readError());
  EXPECT_EQ(sink_->errors().size(), 1u);
}

TEST_F(PreferencesTest, BrokenFileBecomingValidIsReadAgain) {
  writeBytes(file(), "<dmap");
  auto domain = open();
  EXPECT_TRUE(domain->readError());
  writeBytes(file(), dmap::write(Value(Dictionary{{"k", "v"}})).value());
  domain->synchronize();
  EXPECT_FALSE(domain->readError());
  EXPECT_EQ(domain->value("k"), Value("v"));
}

TEST_F(PreferencesTest, WritingReplacesAnUnreadableFile) {
  writeBytes(file(), dmap::write(Value(Array{1})).value());
  auto domain = open();
  ASSERT_TRUE(domain->set("k", "v").ok());
  EXPECT_EQ(fileContents(), (Dictionary{{"k", "v"}}));
  EXPECT_FALSE(domain->readError());
  // The write re-read the same bad version already logged: no second line.
  EXPECT_EQ(sink_->errors().size(), 1u);
}

TEST_F(PreferencesTest, ValueTheFileCannotCarryLeavesItUntouched) {
  auto domain = open();
  ASSERT_TRUE(domain->set("k", "v").ok());
  const std::string before = readBytes(file());
  auto result = domain->set("bad", std::nan(""));
  ASSERT_FALSE(result.ok());
  EXPECT_EQ(result.error().domain, kFormatErrorDomain);
  EXPECT_EQ(readBytes(file()), before);
  EXPECT_FALSE(domain->value("bad"));
}

TEST_F(PreferencesTest, DomainNamesMustBeOnePathComponent) {
  struct Case {
    std::string name;
    bool valid;
  };
  const Case cases[] = {
      {"com.corvane.ekora.userprefs", true},
      {".hidden", true},
      {"with space", true},
      {std::string(kMaxDomainNameLength, 'a'), true},
      {std::string(kMaxDomainNameLength + 1, 'a'), false},
      {"", false},
      {".", false},
      {"..", false},
      {"a/b", false},
      {"/abs", false},
      {"../escape", false},
      {std::string("nul\0byte", 8), false},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    EXPECT_EQ(checkDomainName(c.name).ok(), c.valid);
    auto opened = PreferencesDomain::open(c.name, kUid);
    EXPECT_EQ(opened.ok(), c.valid);
    if (!opened) {
      EXPECT_TRUE(opened.error().isPosix(EINVAL));
    }
  }
  EXPECT_FALSE(fs::exists(state_ / "preferences"));
}

TEST_F(PreferencesTest, FilePreferencesSeesEachChange) {
  FilePreferences preferences(kUid);
  EXPECT_FALSE(preferences.value(kDomain, "k"));
  auto writer = open();
  ASSERT_TRUE(writer->set("k", "one").ok());
  EXPECT_EQ(preferences.value(kDomain, "k"), Value("one"));
  ASSERT_TRUE(writer->set("k", "three").ok());
  EXPECT_EQ(preferences.value(kDomain, "k"), Value("three"));
  EXPECT_FALSE(preferences.value("other.domain", "k"));
  EXPECT_FALSE(preferences.value("../x", "k"));
}

TEST_F(PreferencesTest, FilePreferencesDefaultsToTheEffectiveUser) {
  auto domain = PreferencesDomain::open(kDomain);
  ASSERT_TRUE(domain.ok());
  EXPECT_EQ((*domain)->path(), file(kDomain, geteuid()).string());
  ASSERT_TRUE((*domain)->set("k", true).ok());
  FilePreferences preferences;
  EXPECT_EQ(preferences.value(kDomain, "k"), Value(true));
}

TEST(FakePreferencesTest, AnswersWhatWasSet) {
  FakePreferences preferences;
  EXPECT_FALSE(preferences.value("d", "k"));
  preferences.set("d", "k", 7);
  EXPECT_EQ(preferences.value("d", "k"), Value(7));
  EXPECT_FALSE(preferences.value("other", "k"));
  preferences.remove("d", "k");
  EXPECT_FALSE(preferences.value("d", "k"));
}

}  // namespace
}  // namespace ek::prefs
