#include "ekd/EkDAnnotationStore.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <cmath>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"
#include "platform/log/testing/CapturingSink.h"
#include "platform/testing/Files.h"

namespace ek {
namespace {

namespace fs = std::filesystem;
using namespace std::string_literals;

std::string readBytes(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

// The bytes of a store file holding table, as the store writes it.
std::string fileOf(const Dictionary& table, uint64_t version = 16) {
  return dmap::write(Value(Dictionary{{"data", table}, {"version", version}})).value();
}

Dictionary elected(int64_t election) {
  return Dictionary{{"election", election}};
}

class EkDAnnotationStoreTest : public ::testing::Test {
 protected:
  void SetUp() override { log::setSink(sink_); }
  void TearDown() override { log::setSink(nullptr); }

  // The file Ekora-Annotations in a fresh directory of its own, holding bytes.
  std::string fileWith(std::string_view bytes) {
    std::string file = dir_.file("db" + std::to_string(++files_) + "/Ekora-Annotations");
    EXPECT_TRUE(testing::writeFile(file, bytes));
    return file;
  }
  static std::vector<fs::path> backupsOf(const std::string& file) {
    std::vector<fs::path> found;
    for (const auto& entry : fs::directory_iterator(fs::path(file).parent_path())) {
      if (entry.path().filename().string().starts_with("Ekora-Annotations.bad-")) {
        found.push_back(entry.path());
      }
    }
    return found;
  }
  std::vector<std::string> errors() const {
    std::vector<std::string> found;
    for (const auto& line : sink_->lines()) {
      if (line.level == log::Level::Error) found.push_back(line.message);
    }
    return found;
  }

  testing::TempDir dir_;
  std::shared_ptr<log::testing::CapturingSink> sink_ =
      std::make_shared<log::testing::CapturingSink>();
  int files_ = 0;
};

TEST_F(EkDAnnotationStoreTest, UnusableFilesAreLoggedStartEmptyAndAreKeptAtTheFirstSave) {
  struct Case {
    const char* name;
    std::string bytes;
    std::string domain;
    std::string message;  // the whole message of Ekora errors
  };
  const std::string good = fileOf({{"com.example.one", elected(1)}});
  const Case cases[] = {
      {"version 15", fileOf({}, 15), "Ekora", "found database version 15 needed version 16"},
      {"no version", dmap::write(Value(Dictionary{{"data", Dictionary{}}})).value(), "Ekora",
       "found database version 0 needed version 16"},
      {"root not a dictionary", dmap::write(Value(Array{16})).value(), "Ekora",
       "found database version 0 needed version 16"},
      {"not dmap", "garbage\0\xff that was once a database"s, "Format", ""},
      {"truncated", good.substr(0, good.size() / 2), "Format", ""},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    sink_->clear();
    const std::string file = fileWith(c.bytes);
    auto store = EkDAnnotationStore::initWithDatabase(file);
    ASSERT_NE(store, nullptr);
    EXPECT_TRUE(store->annotations().empty());
    EXPECT_EQ(readBytes(file), c.bytes);  // opening leaves the bad file alone

    Result<void> loaded = store->loadDb(file);
    ASSERT_FALSE(loaded.ok());
    EXPECT_EQ(loaded.error().domain, c.domain);
    if (!c.message.empty()) {
      EXPECT_EQ(loaded.error(), EkError::ekora(7, c.message));
    }
    EXPECT_EQ(errors(),
              std::vector<std::string>{"unable to load annotation database:" + file +
                                       " error:" + loaded.error().message + " (resetting)"});

    // What was there is kept beside the new file, once.
    EXPECT_TRUE(store->setAnnotation(elected(1), "com.example.one").ok());
    EXPECT_TRUE(store->setAnnotation(elected(2), "com.example.one").ok());
    std::vector<fs::path> backups = backupsOf(file);
    ASSERT_EQ(backups.size(), 1u);
    EXPECT_EQ(readBytes(backups[0]), c.bytes);
  }
}

TEST_F(EkDAnnotationStoreTest, EveryChangeMergesAndTheFileIsTheWholeTable) {
  struct Step {
    const char* name;
    std::optional<Dictionary> annotation;
    std::string key;
  };
  const Dictionary extension{{"color", "blue"}};
  const Step steps[] = {
      {"a new value over a stored one", elected(1), "com.example.b"},
      {"an entry before the others", Dictionary{{"extension", extension}}, "com.example.a"},
      {"a merge into an entry", elected(2), "com.example.a"},
      {"an entry after the others", elected(2), "com.example.e"},
      {"a removal", std::nullopt, "com.example.d"},
      {"removing an unknown key", std::nullopt, "com.example.unknown"},
  };
  const std::string file =
      fileWith(fileOf({{"com.example.b", elected(0)}, {"com.example.d", Dictionary{{"x", 1}}}}));
  for (const bool deferred : {false, true}) {
    SCOPED_TRACE(deferred ? "deferred" : "written through");
    auto store = EkDAnnotationStore::initWithDatabase(fileWith(readBytes(file)));
    ASSERT_NE(store, nullptr);
    const std::string before = readBytes(store->annotationsURL());
    if (deferred) store->deferSaves();
    for (const Step& step : steps) {
      EXPECT_TRUE(store->setAnnotation(step.annotation, step.key).ok()) << step.name;
      if (!deferred) {
        EXPECT_EQ(readBytes(store->annotationsURL()), fileOf(store->annotations()));
      }
    }
    const Dictionary expected{
        {"com.example.a", Dictionary{{"election", 2}, {"extension", extension}}},
        {"com.example.b", elected(1)},
        {"com.example.e", elected(2)}};
    EXPECT_EQ(store->annotations(), expected);
    if (deferred) {
      EXPECT_EQ(readBytes(store->annotationsURL()), before);
      EXPECT_TRUE(store->saveDeferred().ok());
    }
    EXPECT_EQ(readBytes(store->annotationsURL()), fileOf(expected));
    // Deferring ends with the save; loading another file replaces the whole table.
    ASSERT_TRUE(store->loadDb(fileWith(fileOf({{"com.example.c", elected(3)}}))).ok());
    EXPECT_TRUE(store->setAnnotation(elected(4), "com.example.f").ok());
    EXPECT_EQ(readBytes(store->annotationsURL()),
              fileOf({{"com.example.c", elected(3)}, {"com.example.f", elected(4)}}));
  }
}

TEST_F(EkDAnnotationStoreTest, ChangesTheFileCannotHoldAreRefusedAndLeaveEverythingAsItWas) {
  // Stored before annotations had a limit.
  const Dictionary big{{"extension", Dictionary{{"s", std::string(70 * 1024, 'b')}}}};
  const Dictionary before{{"com.example.big", big}, {"com.example.one", elected(1)}};
  const std::string file = fileWith(fileOf(before));
  auto store = EkDAnnotationStore::initWithDatabase(file);
  ASSERT_NE(store, nullptr);
  Value deep(Dictionary{});
  // With the file's root, "data" and the annotation, 510 levels are one too many.
  for (int i = 1; i < 510; ++i) deep = Value(Dictionary{{"d", std::move(deep)}});
  const Value refused[] = {
      Value(std::nan("")),
      Value(Date{-62135596801}),  // before the year 0001
      Value("nul\0"s),
      deep,
      Value(std::string(EkDAnnotationStore::kMaxAnnotationSize, 'x')),
  };
  for (const Value& value : refused) {
    const uint64_t generation = store->generation();
    Result<void> set = store->setAnnotation(Dictionary{{"extension", value}}, "com.example.one");
    ASSERT_FALSE(set.ok()) << value.description().substr(0, 80);
    EXPECT_EQ(set.error(), EkError::ekora(18, set.error().message));
    EXPECT_EQ(store->annotations(), before);
    EXPECT_EQ(store->generation(), generation);
  }
  EXPECT_EQ(readBytes(file), fileOf(before));
  // The next change is saved as usual, also one of an annotation above the limit.
  ASSERT_TRUE(store->setAnnotation(elected(2), "com.example.big").ok());
  EXPECT_EQ(readBytes(file), fileOf(store->annotations()));
}

TEST_F(EkDAnnotationStoreTest, FailedSaveUndoesEveryChangeSinceTheLastOne) {
  const Dictionary before{{"com.example.one", elected(1)}, {"com.example.two", elected(2)}};
  const std::string file = fileWith(fileOf(before));
  auto store = EkDAnnotationStore::initWithDatabase(file);
  ASSERT_NE(store, nullptr);
  // A directory where the file was: the rename of any save fails, even for root.
  fs::remove(file);
  fs::create_directories(file + "/in-the-way");

  store->deferSaves();
  ASSERT_TRUE(store->setAnnotation(elected(5), "com.example.one").ok());
  ASSERT_TRUE(store->setAnnotation(std::nullopt, "com.example.two").ok());
  ASSERT_TRUE(store->setAnnotation(elected(3), "com.example.three").ok());
  const uint64_t changed = store->generation();
  Result<void> saved = store->saveDeferred();
  ASSERT_FALSE(saved.ok());
  EXPECT_EQ(saved.error().domain, kPosixErrorDomain);
  EXPECT_EQ(store->annotations(), before);
  // Readers that noted the undone changes see a generation they did not note.
  EXPECT_GT(store->generation(), changed);
  EXPECT_EQ(errors(), std::vector<std::string>{"unable to save annotations:" + file +
                                               " error:" + saved.error().message});
  // A single change that fails its save is not kept either.
  EXPECT_FALSE(store->setAnnotation(elected(4), "com.example.four").ok());
  EXPECT_EQ(store->annotations(), before);

  // Once the file can be written, it holds what was kept and the new change, nothing undone.
  fs::remove_all(file);
  ASSERT_TRUE(store->setAnnotation(elected(6), "com.example.six").ok());
  Dictionary expected = before;
  expected.emplace("com.example.six", elected(6));
  EXPECT_EQ(readBytes(file), fileOf(expected));
}

TEST_F(EkDAnnotationStoreTest, NoChangeMakesTheFileLargerThanAReaderAccepts) {
  auto entry = [](size_t length) { return Dictionary{{"s", std::string(length, 'x')}}; };
  const std::string file = dir_.file("Ekora-Annotations");
  auto store = EkDAnnotationStore::initWithDatabase(file);
  ASSERT_TRUE(store->setAnnotation(entry(1000), "100000").ok());
  const uintmax_t one = fs::file_size(file);
  ASSERT_TRUE(store->setAnnotation(entry(1000), "100001").ok());
  // Entries of one size whose sum crosses the bound by most of an entry.
  const size_t length = 1000 + (dmap::kMaxFileSize - 2048) / 1100 - (fs::file_size(file) - one);
  store->deferSaves();
  Result<void> set;
  for (int i = 100002; set.ok(); ++i) set = store->setAnnotation(entry(length), std::to_string(i));
  EXPECT_EQ(set.error().domain, kPosixErrorDomain);
  ASSERT_TRUE(store->saveDeferred().ok());
  EXPECT_LE(fs::file_size(file), dmap::kMaxFileSize);
}

}  // namespace
}  // namespace ek
