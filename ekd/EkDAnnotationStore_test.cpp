#include "ekd/EkDAnnotationStore.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <mutex>
#include <regex>
#include <string>
#include <vector>

#include "ekd/EkDPlugIn.h"
#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"
#include "platform/log/testing/CapturingSink.h"
#include "platform/vantor/FakeRegistry.h"

namespace ek {
namespace {

namespace fs = std::filesystem;
using namespace std::string_literals;

constexpr std::string_view kFileName = "Ekora-Annotations";

class CapturingSink : public log::testing::CapturingSink {
 public:
  std::vector<std::string> messages(log::Level level) const {
    std::vector<std::string> found;
    for (const Line& line : lines()) {
      if (line.level == level && line.category == "ops") found.push_back(line.message);
    }
    return found;
  }
};

std::string readBytes(const fs::path& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

void writeBytes(const fs::path& path, std::string_view bytes) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << bytes;
}

std::string document(std::string_view body) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<dmap version=\"1.0\">\n" +
         std::string(body) + "\n</dmap>\n";
}

// A well-formed store file of the current version holding table.
std::string currentFile(const Dictionary& table) {
  Result<std::string> bytes = dmap::write(Value(Dictionary{{"version", 16}, {"data", table}}));
  EXPECT_TRUE(bytes.ok());
  return bytes.ok() ? *bytes : std::string();
}

class EkDAnnotationStoreTest : public ::testing::Test {
 public:
  void SetUp() override {
    log::configure("info");
    log::setSink(sink_);
    char pattern[] = "/tmp/ekdannotations-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    root_ = fs::canonical(pattern);
    stateDir_ = root_ / "state";
    const char* previous = ::getenv("EKORA_STATE_DIR");
    if (previous != nullptr) previousStateDir_ = previous;
    ::setenv("EKORA_STATE_DIR", stateDir_.c_str(), 1);
  }
  void TearDown() override {
    log::setSink(nullptr);
    log::configure("default");
    if (previousStateDir_) {
      ::setenv("EKORA_STATE_DIR", previousStateDir_->c_str(), 1);
    } else {
      ::unsetenv("EKORA_STATE_DIR");
    }
    std::error_code ignored;
    fs::permissions(root_, fs::perms::owner_all, fs::perm_options::add, ignored);
    fs::remove_all(root_, ignored);
  }

  // The file named kFileName in a fresh directory of its own, holding bytes.
  fs::path fileWith(std::string_view bytes) {
    fs::path directory = root_ / ("db" + std::to_string(++files_));
    fs::create_directories(directory);
    fs::path file = directory / kFileName;
    writeBytes(file, bytes);
    return file;
  }

  static std::vector<fs::path> backupsOf(const fs::path& file) {
    std::vector<fs::path> found;
    std::string prefix = file.filename().string() + ".bad-";
    for (const auto& entry : fs::directory_iterator(file.parent_path())) {
      if (entry.path().filename().string().rfind(prefix, 0) == 0) found.push_back(entry.path());
    }
    return found;
  }

  // The table the file at path holds, after checking its version.
  static Dictionary tableIn(const fs::path& path) {
    Result<Value> root = dmap::readFile(path.string());
    EXPECT_TRUE(root.ok()) << (root.ok() ? "" : root.error().message);
    if (!root.ok()) return {};
    EXPECT_EQ(root->get("version") ? *root->get("version") : Value(), Value(16));
    const Dictionary* data = root->getDictionary("data");
    EXPECT_NE(data, nullptr);
    return data ? *data : Dictionary{};
  }

  std::shared_ptr<CapturingSink> sink_ = std::make_shared<CapturingSink>();
  fs::path root_;
  fs::path stateDir_;
  std::optional<std::string> previousStateDir_;
  int files_ = 0;
};

// ---- Locations and opening -------------------------------------------------------------------

TEST_F(EkDAnnotationStoreTest, LocationsLieInTheStateDirectory) {
  EXPECT_EQ(EkDAnnotationStore::globalURL(), (stateDir_ / kFileName).string());
  EXPECT_EQ(EkDAnnotationStore::defaultDatabaseURL(), EkDAnnotationStore::globalURL());
  Result<std::string> container = EkDAnnotationStore::containerURL();
  ASSERT_TRUE(container.ok());
  EXPECT_EQ(*container, (stateDir_ / "containers/com.corvane.ekd").string() + "/");
  EXPECT_TRUE(fs::is_directory(*container));
}

TEST_F(EkDAnnotationStoreTest, MissingDefaultFileStartsEmptySilentlyAndFirstChangeCreatesIt) {
  auto store = EkDAnnotationStore::initWithDatabase(std::nullopt);
  ASSERT_NE(store, nullptr);
  EXPECT_EQ(store->annotationsURL(), (stateDir_ / kFileName).string());
  EXPECT_TRUE(store->annotations().empty());
  EXPECT_TRUE(sink_->messages(log::Level::Error).empty());
  // Migration from the container is tried and fails without a word.
  EXPECT_TRUE(sink_->messages(log::Level::Info).empty());
  EXPECT_FALSE(fs::exists(stateDir_ / kFileName));

  EXPECT_TRUE(store->setAnnotation(Dictionary{{"election", 1}}, "com.example.one").ok());

  EXPECT_EQ(tableIn(stateDir_ / kFileName),
            (Dictionary{{"com.example.one", Dictionary{{"election", 1}}}}));
  EXPECT_TRUE(backupsOf(stateDir_ / kFileName).empty());
  EXPECT_TRUE(sink_->messages(log::Level::Error).empty());
}

// ---- Unusable files --------------------------------------------------------------------------

TEST_F(EkDAnnotationStoreTest, UnusableFilesAreLoggedAndStartAnEmptyTable) {
  const std::string good = currentFile({{"com.example.one", Dictionary{{"election", 1}}}});
  struct Case {
    const char* name;
    std::string bytes;
    std::string domain;
    int32_t code;
    // The whole message for Ekora errors; a part of it otherwise.
    std::string message;
  };
  const Case cases[] = {
      {"version 15",
       document("<dict><key>version</key><integer>15</integer><key>data</key><dict/></dict>"),
       "Ekora", 7, "found database version 15 needed version 16"},
      {"no version", document("<dict><key>data</key><dict/></dict>"), "Ekora", 7,
       "found database version 0 needed version 16"},
      {"version not a number",
       document("<dict><key>version</key><string>16</string><key>data</key><dict/></dict>"),
       "Ekora", 7, "found database version 0 needed version 16"},
      {"huge version",
       document("<dict><key>version</key><integer>18446744073709551615</integer></dict>"), "Ekora",
       7, "found database version -1 needed version 16"},
      {"version 16 above 32 bits",
       document("<dict><key>version</key><integer>4294967312</integer></dict>"), "Ekora", 7,
       "found database version 16 needed version 16"},
      {"negative version", document("<dict><key>version</key><integer>-3</integer></dict>"),
       "Ekora", 7, "found database version -3 needed version 16"},
      {"root not a dictionary", document("<array><integer>16</integer></array>"), "Ekora", 7,
       "found database version 0 needed version 16"},
      {"not dmap", "this is not a database\n", "Format", 1, ""},
      {"truncated", good.substr(0, good.size() / 2), "Format", 1, ""},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    sink_->clear();
    fs::path file = fileWith(c.bytes);

    auto store = EkDAnnotationStore::initWithDatabase(file.string());
    ASSERT_NE(store, nullptr);
    EXPECT_TRUE(store->annotations().empty());
    // Opening leaves the bad file alone.
    EXPECT_EQ(readBytes(file), c.bytes);

    Result<void> loaded = store->loadDb(file.string());
    ASSERT_FALSE(loaded.ok());
    EXPECT_EQ(loaded.error().domain, c.domain);
    EXPECT_EQ(loaded.error().code, c.code);
    if (c.domain == "Ekora") {
      EXPECT_EQ(loaded.error().message, c.message);
    } else {
      EXPECT_NE(loaded.error().message.find(file.string()), std::string::npos);
    }
    EXPECT_EQ(sink_->messages(log::Level::Error),
              std::vector<std::string>{"unable to load annotation database:" + file.string() +
                                       " error:" + loaded.error().message + " (resetting)"});
  }
}

TEST_F(EkDAnnotationStoreTest, FailedLoadLeavesTheTableAsItWas) {
  const Dictionary table{{"com.example.one", Dictionary{{"election", 1}}}};
  fs::path file = fileWith(currentFile(table));
  auto store = EkDAnnotationStore::initWithDatabase(file.string());
  ASSERT_NE(store, nullptr);
  ASSERT_EQ(store->annotations(), table);

  fs::path old =
      fileWith(document("<dict><key>version</key><integer>15</integer><key>data</key><dict>"
                        "<key>com.example.old</key><dict/></dict></dict>"));
  EXPECT_FALSE(store->loadDb(old.string()).ok());
  EXPECT_FALSE(store->loadDb((root_ / "missing").string()).ok());
  EXPECT_EQ(store->annotations(), table);
}

TEST_F(EkDAnnotationStoreTest, LoadReplacesTheTableWithTheFilesData) {
  fs::path first = fileWith(currentFile({{"com.example.one", Dictionary{{"election", 1}}}}));
  const Dictionary other{{"com.example.two", Dictionary{{"election", 2}}}};
  fs::path second = fileWith(currentFile(other));
  auto store = EkDAnnotationStore::initWithDatabase(first.string());
  ASSERT_NE(store, nullptr);

  ASSERT_TRUE(store->loadDb(second.string()).ok());
  EXPECT_EQ(store->annotations(), other);
  EXPECT_EQ(store->annotationForIdentifier("com.example.one"), std::nullopt);
}

TEST_F(EkDAnnotationStoreTest, DataThatIsNotADictionaryStartsAnEmptyTable) {
  const std::string bytes = document(
      "<dict><key>version</key><integer>16</integer><key>data</key>"
      "<array><string>com.example.one</string></array></dict>");
  fs::path file = fileWith(bytes);
  auto store = EkDAnnotationStore::initWithDatabase(file.string());
  ASSERT_NE(store, nullptr);
  EXPECT_TRUE(store->annotations().empty());
  EXPECT_TRUE(sink_->messages(log::Level::Error).empty());

  // What was there is kept beside the new file.
  EXPECT_TRUE(store->setAnnotation(Dictionary{{"election", 1}}, "com.example.one").ok());
  std::vector<fs::path> backups = backupsOf(file);
  ASSERT_EQ(backups.size(), 1u);
  EXPECT_EQ(readBytes(backups[0]), bytes);
}

// ---- Changes ---------------------------------------------------------------------------------

TEST_F(EkDAnnotationStoreTest, MergeKeepsOtherEntriesAndReplacesSameNamedOnes) {
  const Dictionary extension{{"color", "blue"}, {"count", 3}};
  fs::path file = fileWith(
      currentFile({{"com.example.one", Dictionary{{"election", 0}, {"extension", extension}}},
                   {"com.example.two", Dictionary{{"election", 1}}}}));
  auto store = EkDAnnotationStore::initWithDatabase(file.string());
  ASSERT_NE(store, nullptr);

  EXPECT_TRUE(store->setAnnotation(Dictionary{{"election", 1}}, "com.example.one").ok());

  const Dictionary merged{{"election", 1}, {"extension", extension}};
  EXPECT_EQ(store->annotationForIdentifier("com.example.one"), merged);
  EXPECT_EQ(store->annotationForIdentifier("com.example.two"), (Dictionary{{"election", 1}}));
  EXPECT_EQ(tableIn(file), (Dictionary{{"com.example.one", merged},
                                       {"com.example.two", Dictionary{{"election", 1}}}}));
  EXPECT_TRUE(backupsOf(file).empty());
}

TEST_F(EkDAnnotationStoreTest, SettingNothingRemovesTheWholeAnnotationAndRewritesTheFile) {
  fs::path file = fileWith(currentFile(
      {{"com.example.one", Dictionary{{"election", 1}, {"extension", Dictionary{{"a", 1}}}}},
       {"com.example.two", Dictionary{{"election", 2}}}}));
  auto store = EkDAnnotationStore::initWithDatabase(file.string());
  ASSERT_NE(store, nullptr);

  EXPECT_TRUE(store->setAnnotation(std::nullopt, "com.example.one").ok());

  EXPECT_EQ(store->annotationForIdentifier("com.example.one"), std::nullopt);
  const Dictionary rest{{"com.example.two", Dictionary{{"election", 2}}}};
  EXPECT_EQ(store->annotations(), rest);
  EXPECT_EQ(tableIn(file), rest);
}

TEST_F(EkDAnnotationStoreTest, RemovingAnUnknownKeyStillSaves) {
  auto store = EkDAnnotationStore::initWithDatabase((root_ / kFileName).string());
  ASSERT_NE(store, nullptr);
  EXPECT_TRUE(store->setAnnotation(std::nullopt, "com.example.unknown").ok());
  EXPECT_EQ(tableIn(root_ / kFileName), Dictionary{});
}

TEST_F(EkDAnnotationStoreTest, DeferredChangesReachTheFileInOneSaveAtTheEnd) {
  fs::path file = fileWith(currentFile({{"com.example.one", Dictionary{{"election", 0}}}}));
  auto store = EkDAnnotationStore::initWithDatabase(file.string());
  ASSERT_NE(store, nullptr);
  store->deferSaves();
  EXPECT_TRUE(store->setAnnotation(Dictionary{{"election", 1}}, "com.example.one").ok());
  EXPECT_TRUE(store->setAnnotation(Dictionary{{"election", 2}}, "com.example.two").ok());
  EXPECT_TRUE(store->setAnnotation(std::nullopt, "com.example.one").ok());
  // Memory has every change at once; the file is untouched until the end.
  EXPECT_EQ(store->annotations(), (Dictionary{{"com.example.two", Dictionary{{"election", 2}}}}));
  EXPECT_EQ(tableIn(file), (Dictionary{{"com.example.one", Dictionary{{"election", 0}}}}));
  EXPECT_TRUE(store->saveDeferred().ok());
  EXPECT_EQ(tableIn(file), (Dictionary{{"com.example.two", Dictionary{{"election", 2}}}}));
  // Deferring ends with the save: the next change is written through again.
  EXPECT_TRUE(store->setAnnotation(Dictionary{{"election", 3}}, "com.example.two").ok());
  EXPECT_EQ(tableIn(file), (Dictionary{{"com.example.two", Dictionary{{"election", 3}}}}));
}

TEST_F(EkDAnnotationStoreTest, FileAfterEveryKindOfChangeIsTheWholeTableWritten) {
  fs::path file = fileWith(currentFile({{"com.example.b", Dictionary{{"election", 0}}},
                                        {"com.example.d", Dictionary{{"election", 1}}}}));
  auto store = EkDAnnotationStore::initWithDatabase(file.string());
  ASSERT_NE(store, nullptr);
  auto expectWholeTable = [&](const char* after) {
    const Value document(Dictionary{{"data", Value(store->annotations())}, {"version", Value(16)}});
    std::ifstream in(file, std::ios::binary);
    std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    EXPECT_EQ(bytes, dmap::write(document).value()) << "after " << after;
  };
  EXPECT_TRUE(store->setAnnotation(Dictionary{{"election", 1}}, "com.example.b").ok());
  expectWholeTable("a change");
  EXPECT_TRUE(
      store->setAnnotation(Dictionary{{"extension", Dictionary{{"k", "v"}}}}, "com.example.a")
          .ok());
  expectWholeTable("an entry before the others");
  EXPECT_TRUE(store->setAnnotation(Dictionary{{"election", 2}}, "com.example.e").ok());
  expectWholeTable("an entry after the others");
  EXPECT_TRUE(store->setAnnotation(std::nullopt, "com.example.d").ok());
  expectWholeTable("a removal");
  // Another file loaded, with another value under a key written before.
  ASSERT_TRUE(store
                  ->loadDb(fileWith(currentFile({{"com.example.b", Dictionary{{"election", 9}}},
                                                 {"com.example.c", Dictionary{{"election", 3}}}}))
                               .string())
                  .ok());
  EXPECT_TRUE(store->setAnnotation(Dictionary{{"election", 4}}, "com.example.f").ok());
  EXPECT_EQ(tableIn(file), (Dictionary{{"com.example.b", Dictionary{{"election", 9}}},
                                       {"com.example.c", Dictionary{{"election", 3}}},
                                       {"com.example.f", Dictionary{{"election", 4}}}}));
  expectWholeTable("a load");
  // A value dmap cannot hold is refused; the next change is saved as usual.
  EXPECT_FALSE(store->setAnnotation(Dictionary{{"name", "\xff"}}, "com.example.g").ok());
  EXPECT_TRUE(store->setAnnotation(Dictionary{{"election", 5}}, "com.example.h").ok());
  expectWholeTable("a refused change");
  EXPECT_TRUE(tableIn(file).contains("com.example.h"));
  EXPECT_TRUE(store->setAnnotation(std::nullopt, "com.example.b").ok());
  EXPECT_TRUE(store->setAnnotation(std::nullopt, "com.example.c").ok());
  EXPECT_TRUE(store->setAnnotation(std::nullopt, "com.example.f").ok());
  expectWholeTable("removing everything");
}

TEST_F(EkDAnnotationStoreTest, ReloadRoundTripsEveryValueType) {
  const Dictionary annotation{
      {"election", 257},
      {"negative", -42},
      {"huge", uint64_t{18446744073709551615u}},
      {"text", "élection <&> \"quoted\""},
      {"empty", ""},
      {"yes", true},
      {"no", false},
      {"real", 1.5},
      {"date", Date{1700000000}},
      {"data", Data{0, 1, 2, 0xfe, 0xff}},
      {"list", Array{Value(1), Value("two"), Value(Array{}), Value(Dictionary{{"x", false}})}},
      {"extension", Dictionary{{"nested", Dictionary{{"deep", Array{Value(Data{})}}}}}},
  };
  fs::path file = root_ / kFileName;
  {
    auto store = EkDAnnotationStore::initWithDatabase(file.string());
    ASSERT_NE(store, nullptr);
    EXPECT_TRUE(store->setAnnotation(annotation, "com.example.one").ok());
  }
  auto reopened = EkDAnnotationStore::initWithDatabase(file.string());
  ASSERT_NE(reopened, nullptr);
  EXPECT_EQ(reopened->annotationForIdentifier("com.example.one"), annotation);
  EXPECT_EQ(reopened->annotations().size(), 1u);
  EXPECT_TRUE(sink_->messages(log::Level::Error).empty());
}

// ---- Keeping a bad file ----------------------------------------------------------------------

TEST_F(EkDAnnotationStoreTest, BadFileIsKeptBesideWithItsBytesBeforeTheFirstSave) {
  const std::string bytes = "garbage\0\xff that was once a database"s;
  fs::path file = fileWith(bytes);
  auto store = EkDAnnotationStore::initWithDatabase(file.string());
  ASSERT_NE(store, nullptr);
  EXPECT_TRUE(backupsOf(file).empty());

  EXPECT_TRUE(store->setAnnotation(Dictionary{{"election", 1}}, "com.example.one").ok());

  std::vector<fs::path> backups = backupsOf(file);
  ASSERT_EQ(backups.size(), 1u);
  EXPECT_TRUE(std::regex_match(backups[0].filename().string(),
                               std::regex("Ekora-Annotations\\.bad-\\d{8}T\\d{6}Z")));
  EXPECT_EQ(readBytes(backups[0]), bytes);
  EXPECT_EQ(tableIn(file), (Dictionary{{"com.example.one", Dictionary{{"election", 1}}}}));

  // Once kept, later saves just replace the file.
  EXPECT_TRUE(store->setAnnotation(Dictionary{{"election", 2}}, "com.example.one").ok());
  EXPECT_EQ(backupsOf(file).size(), 1u);
  EXPECT_EQ(readBytes(backups[0]), bytes);
}

TEST_F(EkDAnnotationStoreTest, BadFileKeptUnderANumberedNameWhenTheStampedOneIsTaken) {
  const std::string bytes = document("<dict><key>version</key><integer>15</integer></dict>");
  fs::path file = fileWith(bytes);
  // Take the stamped names of the next minute, so the save must number its name.
  std::time_t now = std::time(nullptr);
  for (int second = 0; second < 60; ++second) {
    std::time_t when = now + second;
    std::tm utc{};
    gmtime_r(&when, &utc);
    char stamp[32];
    std::strftime(stamp, sizeof stamp, "%Y%m%dT%H%M%SZ", &utc);
    writeBytes(file.string() + ".bad-" + stamp, "taken");
  }
  auto store = EkDAnnotationStore::initWithDatabase(file.string());
  ASSERT_NE(store, nullptr);
  EXPECT_TRUE(store->setAnnotation(Dictionary{{"election", 1}}, "com.example.one").ok());

  std::vector<fs::path> numbered;
  for (const fs::path& backup : backupsOf(file)) {
    if (readBytes(backup) != "taken") numbered.push_back(backup);
  }
  ASSERT_EQ(numbered.size(), 1u);
  EXPECT_TRUE(std::regex_match(numbered[0].filename().string(),
                               std::regex("Ekora-Annotations\\.bad-\\d{8}T\\d{6}Z-1")));
  EXPECT_EQ(readBytes(numbered[0]), bytes);
}

TEST_F(EkDAnnotationStoreTest, NoBackupWhenTheFileWasFineOrMissing) {
  fs::path fine = fileWith(currentFile({{"com.example.one", Dictionary{{"election", 1}}}}));
  fs::path missing = root_ / "missing" / kFileName;
  for (const fs::path& file : {fine, missing}) {
    SCOPED_TRACE(file.string());
    auto store = EkDAnnotationStore::initWithDatabase(file.string());
    ASSERT_NE(store, nullptr);
    EXPECT_TRUE(store->setAnnotation(Dictionary{{"election", 2}}, "com.example.two").ok());
    EXPECT_TRUE(backupsOf(file).empty());
    EXPECT_EQ(tableIn(file).count("com.example.two"), 1u);
  }
}

// ---- Refusals and failed saves ---------------------------------------------------------------

TEST_F(EkDAnnotationStoreTest, ChangesTheFileCannotHoldAreRefusedAndLeaveEverythingAsItWas) {
  // Stored before annotations had a limit.
  const Dictionary big{{"extension", Dictionary{{"s", std::string(70 * 1024, 'b')}}}};
  const Dictionary before{{"com.example.big", big},
                          {"com.example.one", Dictionary{{"election", 1}}}};
  fs::path file = fileWith(currentFile(before));
  const std::string bytes = readBytes(file);
  auto store = EkDAnnotationStore::initWithDatabase(file.string());
  ASSERT_NE(store, nullptr);
  Value deep(Dictionary{});
  // With the file's root, "data" and the annotation, 510 levels are one too many.
  for (int i = 1; i < 510; ++i) deep = Value(Dictionary{{"d", std::move(deep)}});
  const std::vector<Value> refused = {
      Value(std::nan("")),
      Value(Date{-62135596801}),  // before the year 0001
      Value("nul\0"s),
      Value("\xef\xbf\xbe"),  // U+FFFE
      Value(Dictionary{{"key\x1f", Value(1)}}),
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
  EXPECT_EQ(readBytes(file), bytes);
  // The next change is saved as usual, also one of an annotation above the limit.
  ASSERT_TRUE(store->setAnnotation(Dictionary{{"election", 2}}, "com.example.two").ok());
  ASSERT_TRUE(store->setAnnotation(Dictionary{{"election", 1}}, "com.example.big").ok());
  EXPECT_EQ(tableIn(file).size(), 3u);
}

TEST_F(EkDAnnotationStoreTest, FailedSaveUndoesEveryChangeSinceTheLastOne) {
  const Dictionary before{{"com.example.one", Dictionary{{"election", 1}}},
                          {"com.example.two", Dictionary{{"election", 2}}}};
  fs::path file = fileWith(currentFile(before));
  auto store = EkDAnnotationStore::initWithDatabase(file.string());
  ASSERT_NE(store, nullptr);
  // A directory where the file was: the rename of any save fails, even for root.
  fs::remove(file);
  fs::create_directories(file / "in-the-way");

  store->deferSaves();
  ASSERT_TRUE(store->setAnnotation(Dictionary{{"election", 5}}, "com.example.one").ok());
  ASSERT_TRUE(store->setAnnotation(std::nullopt, "com.example.two").ok());
  ASSERT_TRUE(store->setAnnotation(Dictionary{{"election", 3}}, "com.example.three").ok());
  const uint64_t changed = store->generation();
  Result<void> saved = store->saveDeferred();
  ASSERT_FALSE(saved.ok());
  EXPECT_EQ(saved.error().domain, kPosixErrorDomain);
  EXPECT_EQ(store->annotations(), before);
  // Readers that noted the undone changes see a generation they did not note.
  EXPECT_GT(store->generation(), changed);
  std::vector<std::string> errors = sink_->messages(log::Level::Error);
  ASSERT_EQ(errors.size(), 1u);
  EXPECT_EQ(errors[0],
            "unable to save annotations:" + file.string() + " error:" + saved.error().message);

  // A single change that fails its save is not kept either.
  Result<void> single = store->setAnnotation(Dictionary{{"election", 4}}, "com.example.four");
  ASSERT_FALSE(single.ok());
  EXPECT_EQ(single.error().domain, kPosixErrorDomain);
  EXPECT_EQ(store->annotations(), before);

  // Once the file can be written, it holds what was kept and the new change, nothing undone.
  fs::remove_all(file);
  ASSERT_TRUE(store->setAnnotation(Dictionary{{"election", 6}}, "com.example.six").ok());
  Dictionary expected = before;
  expected.emplace("com.example.six", Dictionary{{"election", 6}});
  EXPECT_EQ(tableIn(file), expected);
}

TEST_F(EkDAnnotationStoreTest, BadFileThatCannotBeKeptIsLoggedAndReplaced) {
  const std::string bytes = "not a database";
  fs::path file = fileWith(bytes);
  // Every name a copy could take in the next few seconds is taken.
  std::time_t now = std::time(nullptr);
  for (std::time_t when = now - 1; when < now + 6; ++when) {
    std::tm utc{};
    gmtime_r(&when, &utc);
    char stamp[32];
    std::strftime(stamp, sizeof stamp, "%Y%m%dT%H%M%SZ", &utc);
    const std::string base = file.string() + ".bad-" + stamp;
    writeBytes(base, "taken");
    for (int n = 1; n < 100; ++n) writeBytes(base + "-" + std::to_string(n), "taken");
  }
  auto store = EkDAnnotationStore::initWithDatabase(file.string());
  ASSERT_NE(store, nullptr);
  sink_->clear();

  ASSERT_TRUE(store->setAnnotation(Dictionary{{"election", 1}}, "com.example.one").ok());

  EXPECT_EQ(tableIn(file), (Dictionary{{"com.example.one", Dictionary{{"election", 1}}}}));
  std::vector<std::string> errors = sink_->messages(log::Level::Error);
  ASSERT_EQ(errors.size(), 1u);
  EXPECT_NE(errors[0].find("unable to keep unusable annotation database:" + file.string()),
            std::string::npos)
      << errors[0];
}

TEST_F(EkDAnnotationStoreTest, TemporariesOfAKilledDaemonAreRemovedAtOpening) {
  fs::path file = fileWith(currentFile({{"com.example.one", Dictionary{{"election", 1}}}}));
  writeBytes(file.parent_path() / ".Ekora-Annotations.Ab12Cd", "partial");
  writeBytes(file.parent_path() / "Ekora-Annotations.bad-20260101T000000Z", "kept");
  auto store = EkDAnnotationStore::initWithDatabase(file.string());
  ASSERT_NE(store, nullptr);
  std::vector<std::string> left;
  for (const auto& entry : fs::directory_iterator(file.parent_path())) {
    left.push_back(entry.path().filename().string());
  }
  std::sort(left.begin(), left.end());
  EXPECT_EQ(left, (std::vector<std::string>{"Ekora-Annotations",
                                            "Ekora-Annotations.bad-20260101T000000Z"}));
}

// ---- Plug-ins --------------------------------------------------------------------------------

TEST_F(EkDAnnotationStoreTest, PlugInsSharingAnAnnotationKeyShareOneAnnotation) {
  fs::path examples = EXAMPLES_DIR;
  Result<Value> info = dmap::readFile(
      (examples / "Applications/Viewer.app/PlugIns/Thumbs.appex/Info.dmap").string());
  ASSERT_TRUE(info.ok());
  auto registry = std::make_shared<vantor::FakeRegistry>();
  auto proxyFor = [&](const std::string& identifier, const fs::path& path) {
    vantor::PlugInProxy proxy;
    proxy.uuid = Uuid::random();
    proxy.info = *info->dictionary();
    proxy.info["QvBundleIdentifier"] = identifier;
    proxy.identifier = identifier;
    proxy.originalIdentifier = identifier;
    proxy.path = path.string();
    proxy.url = vantor::fileUrlForPath(proxy.path);
    proxy.containingAppPath = (root_ / "Viewer.app").string();
    proxy.containingAppName = "Viewer";
    proxy.dataContainerPath = (root_ / "containers" / identifier).string();
    proxy.extensionPoint = "com.corvane.thumbnail";
    return proxy;
  };
  vantor::PlugInProxy original =
      proxyFor("com.corvane.example.viewer.thumbs", root_ / "Viewer.app/PlugIns/Thumbs.appex");
  vantor::PlugInProxy replacement =
      proxyFor("com.example.newthumbs", root_ / "Viewer.app/PlugIns/NewThumbs.appex");
  replacement.entitlements["com.corvane.developer.replace-plugin"] =
      "com.corvane.example.viewer.thumbs";
  registry->install(original);
  registry->install(replacement);
  EkDPlugInContext context{registry, nullptr, (root_ / "System").string()};
  auto first = EkDPlugIn::createWithVRData(original, context);
  auto second = EkDPlugIn::createWithVRData(replacement, context);
  ASSERT_NE(first, nullptr);
  ASSERT_NE(second, nullptr);

  auto store = EkDAnnotationStore::initWithDatabase((root_ / kFileName).string());
  ASSERT_NE(store, nullptr);
  EXPECT_TRUE(store->setAnnotation(Dictionary{{"election", 1}}, *first).ok());
  EXPECT_TRUE(
      store->setAnnotation(Dictionary{{"extension", Dictionary{{"k", "v"}}}}, *second).ok());

  const Dictionary shared{{"election", 1}, {"extension", Dictionary{{"k", "v"}}}};
  EXPECT_EQ(store->annotationForPlugIn(*first), shared);
  EXPECT_EQ(store->annotationForPlugIn(*second), shared);
  EXPECT_EQ(tableIn(root_ / kFileName),
            (Dictionary{{"com.corvane.example.viewer.thumbs", shared}}));

  EXPECT_TRUE(store->setAnnotation(std::nullopt, *second).ok());
  EXPECT_EQ(store->annotationForPlugIn(*first), std::nullopt);
}

}  // namespace
}  // namespace ek
