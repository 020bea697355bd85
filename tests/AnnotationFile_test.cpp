// The daemon facing a bad or unwritable annotation file: it starts, answers, keeps what a
// person could recover, and never loses a change it acknowledged from memory.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <sstream>

#include "platform/dmap/Dmap.h"
#include "platform/value/Uuid.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;

constexpr const char* kThumbsId = "com.corvane.example.viewer.thumbs";
constexpr const char* kResetting = "unable to load annotation database:";

constexpr const char* kVersion16 = R"(<?xml version="1.0" encoding="UTF-8"?>
<dmap version="1.0">
<dict>
	<key>data</key>
	<dict>
		<key>com.corvane.example.viewer.share</key>
		<dict>
			<key>election</key>
			<integer>1</integer>
		</dict>
	</dict>
	<key>version</key>
	<integer>16</integer>
</dict>
</dmap>
)";

std::string readBytes(const fs::path& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream bytes;
  bytes << in.rdbuf();
  return bytes.str();
}

void writeBytes(const fs::path& path, const std::string& bytes) {
  std::ofstream(path, std::ios::binary) << bytes;
}

std::string replaceAll(std::string text, const std::string& from, const std::string& to) {
  for (size_t at = text.find(from); at != std::string::npos; at = text.find(from, at + to.size())) {
    text.replace(at, from.size(), to);
  }
  return text;
}

// The lines of a log that hold needle.
std::vector<std::string> linesWith(const std::string& log, const std::string& needle) {
  std::vector<std::string> lines;
  std::istringstream in(log);
  for (std::string line; std::getline(in, line);) {
    if (line.find(needle) != std::string::npos) lines.push_back(line);
  }
  return lines;
}

class AnnotationFile : public ::testing::Test {
 protected:
  AnnotationFile() : daemon_({"-d", (dbDir() / "Ekora-Annotations").string()}) {}

  // The directory of the annotation file, inside the daemon's private root. The constructor
  // needs it before daemon_ exists, so it lives in a directory of its own.
  fs::path dbDir() const { return fs::canonical(dbRoot_.path()) / "db"; }

  void SetUp() override {
    fs::create_directories(dbDir());
    root_ = fs::canonical(daemon_.root().path());
    fs::copy(fs::path(EXAMPLES_DIR) / "Applications/Viewer.app", root_ / "Viewer.app",
             fs::copy_options::recursive);
  }
  void TearDown() override {
    if (daemon_.running()) {
      EXPECT_EQ(daemon_.terminate(), 0) << daemon_.log();
    }
  }

  fs::path file() const { return daemon_.annotationFile(); }

  std::optional<Value> ask(const Value& message) {
    auto reply = daemon_.ask(message);
    EXPECT_TRUE(reply.has_value()) << "no reply to " << message.description() << "\n"
                                   << daemon_.log();
    return reply;
  }

  // Starts the daemon, registers Viewer.app and answers the thumbnail plug-in's UUID.
  std::optional<Uuid> startWithThumbs() {
    if (!daemon_.start()) {
      ADD_FAILURE() << "ekd did not start:\n" << daemon_.log();
      return std::nullopt;
    }
    auto added =
        ask(request("add", {{"paths", Value(Array{Value((root_ / "Viewer.app").string())})}}));
    if (!added || replyErrorCode(*added) != 0) return std::nullopt;
    std::string url = "file://" + (root_ / "Viewer.app/PlugIns/Thumbs.appex").string();
    auto found = ask(request("find", {{"paths", Value(url)}}));
    const Value* form = found ? found->get("matches") : nullptr;
    if (!form || !form->getString("uuid")) return std::nullopt;
    return Uuid::parse(*form->getString("uuid"));
  }

  bool annotate(const Uuid& uuid, Dictionary change) {
    auto reply = ask(request("annotate", {{"annotations", Value(std::move(change))},
                                          {"uuids", Value(Array{Value(uuid)})}}));
    return reply && replyErrorCode(*reply) == 0 && replyError(*reply).empty();
  }

  Value foundAnnotations(const Uuid& uuid) {
    auto reply = ask(request("find", {{"uuids", Value(uuid)}}));
    const Value* form = reply ? reply->get("matches") : nullptr;
    const Value* annotations = form ? form->get("annotations") : nullptr;
    return annotations ? *annotations : Value("<absent>");
  }

  // The files kept aside beside the annotation file.
  std::vector<fs::path> keptAside() const {
    std::vector<fs::path> kept;
    std::string prefix = file().filename().string() + ".bad-";
    for (const auto& entry : fs::directory_iterator(file().parent_path())) {
      if (entry.path().filename().string().rfind(prefix, 0) == 0) kept.push_back(entry.path());
    }
    return kept;
  }

  // The file's "data" when it is a version 16 annotation file.
  std::optional<Dictionary> storedData() const {
    auto parsed = dmap::readFile(file());
    if (!parsed) return std::nullopt;
    const uint64_t* version = parsed.value().getUnsigned("version");
    const Dictionary* data = parsed.value().getDictionary("data");
    if (!version || *version != 16 || !data) return std::nullopt;
    return *data;
  }

  TempDir dbRoot_;
  EkdProcess daemon_;
  fs::path root_;
};

struct BadFile {
  const char* name;
  std::string bytes;
  // Text the "(resetting)" line must carry besides the file's path; empty for none.
  const char* detail;
};

std::vector<BadFile> badFiles() {
  std::string valid = kVersion16;
  return {
      {"garbage", std::string{'\0', '\1', '\2'} + " not an annotation file \xff\xfe", ""},
      {"truncated", valid.substr(0, valid.size() / 2), ""},
      {"version15", replaceAll(valid, "<integer>16</integer>", "<integer>15</integer>"),
       "found database version 15 needed version 16"},
      {"noVersion", replaceAll(valid, "\t<key>version</key>\n\t<integer>16</integer>\n", ""),
       "found database version 0 needed version 16"},
      {"versionAsText", replaceAll(valid, "<integer>16</integer>", "<string>16</string>"),
       "found database version 0 needed version 16"},
      {"json", R"({"version": 16, "data": {}})", ""},
      {"empty", "", ""},
      {"notADictionary",
       "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<dmap version=\"1.0\">\n<array/>\n</dmap>\n",
       ""},
  };
}

TEST_F(AnnotationFile, BadFilesAreLoggedKeptAsideAndReplaced) {
  for (const BadFile& bad : badFiles()) {
    SCOPED_TRACE(bad.name);
    if (daemon_.running()) {
      ASSERT_EQ(daemon_.terminate(), 0);
    }
    for (const auto& entry : fs::directory_iterator(dbDir())) fs::remove_all(entry.path());
    size_t logBefore = daemon_.log().size();
    writeBytes(file(), bad.bytes);

    auto thumbs = startWithThumbs();
    ASSERT_TRUE(thumbs) << daemon_.log();
    std::string log = daemon_.log().substr(logBefore);
    auto lines = linesWith(log, kResetting);
    ASSERT_EQ(lines.size(), 1u) << log;
    EXPECT_NE(lines[0].find("(resetting)"), std::string::npos) << lines[0];
    EXPECT_NE(lines[0].find(file().string()), std::string::npos) << lines[0];
    EXPECT_NE(lines[0].find(bad.detail), std::string::npos) << lines[0];
    // Nothing is touched before the first change.
    EXPECT_EQ(readBytes(file()), bad.bytes);
    EXPECT_TRUE(keptAside().empty());
    // The table started empty.
    EXPECT_EQ(foundAnnotations(*thumbs), Value(Dictionary{}));

    ASSERT_TRUE(annotate(*thumbs, {{"election", Value(1)}}));
    auto kept = keptAside();
    ASSERT_EQ(kept.size(), 1u);
    EXPECT_EQ(readBytes(kept[0]), bad.bytes);
    auto data = storedData();
    ASSERT_TRUE(data) << readBytes(file());
    EXPECT_EQ(*data, (Dictionary{{kThumbsId, Value(Dictionary{{"election", Value(1)}})}}));

    // Later saves replace the file without keeping another copy.
    ASSERT_TRUE(annotate(*thumbs, {{"election", Value(2)}}));
    EXPECT_EQ(keptAside().size(), 1u);
    data = storedData();
    ASSERT_TRUE(data);
    EXPECT_EQ(*data, (Dictionary{{kThumbsId, Value(Dictionary{{"election", Value(2)}})}}));
  }
}

TEST_F(AnnotationFile, ValidFileIsLoadedWithoutComplaint) {
  writeBytes(file(), kVersion16);
  auto thumbs = startWithThumbs();
  ASSERT_TRUE(thumbs);
  EXPECT_EQ(daemon_.log().find(kResetting), std::string::npos) << daemon_.log();
  ASSERT_TRUE(annotate(*thumbs, {{"election", Value(1)}}));
  EXPECT_TRUE(keptAside().empty());
  auto data = storedData();
  ASSERT_TRUE(data);
  // The loaded entry is kept beside the new one.
  EXPECT_EQ(*data, (Dictionary{{kThumbsId, Value(Dictionary{{"election", Value(1)}})},
                               {"com.corvane.example.viewer.share",
                                Value(Dictionary{{"election", Value(1)}})}}));
}

TEST_F(AnnotationFile, MissingFileIsSilentAndCreatedByTheFirstChange) {
  auto thumbs = startWithThumbs();
  ASSERT_TRUE(thumbs);
  EXPECT_EQ(daemon_.log().find(kResetting), std::string::npos) << daemon_.log();
  EXPECT_FALSE(fs::exists(file()));
  ASSERT_TRUE(annotate(*thumbs, {{"election", Value(1)}}));
  EXPECT_TRUE(keptAside().empty());
  auto data = storedData();
  ASSERT_TRUE(data) << readBytes(file());
  EXPECT_EQ(*data, (Dictionary{{kThumbsId, Value(Dictionary{{"election", Value(1)}})}}));
}

TEST_F(AnnotationFile, DataThatIsNotADictionaryStartsAnEmptyTable) {
  writeBytes(file(),
             "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<dmap version=\"1.0\">\n<dict>\n"
             "\t<key>data</key>\n\t<array>\n\t\t<string>x</string>\n\t</array>\n"
             "\t<key>version</key>\n\t<integer>16</integer>\n</dict>\n</dmap>\n");
  auto thumbs = startWithThumbs();
  ASSERT_TRUE(thumbs) << daemon_.log();
  EXPECT_EQ(foundAnnotations(*thumbs), Value(Dictionary{}));
  ASSERT_TRUE(annotate(*thumbs, {{"election", Value(1)}}));
  auto data = storedData();
  ASSERT_TRUE(data) << readBytes(file());
  EXPECT_EQ(*data, (Dictionary{{kThumbsId, Value(Dictionary{{"election", Value(1)}})}}));
}

// A directory replaced by a plain file refuses every write, also to root.
TEST_F(AnnotationFile, FailedSaveIsAnErrorReplyAndTheChangeIsNotKept) {
  auto thumbs = startWithThumbs();
  ASSERT_TRUE(thumbs);
  fs::path aside = dbDir().string() + ".aside";
  fs::rename(dbDir(), aside);
  writeBytes(dbDir(), "not a directory");

  auto reply = ask(request("annotate", {{"annotations", Value(Dictionary{{"election", Value(1)}})},
                                        {"uuids", Value(Array{Value(*thumbs)})}}));
  ASSERT_TRUE(reply);
  EXPECT_GT(replyErrorCode(*reply), 0) << reply->description();
  std::string log = daemon_.log();
  EXPECT_NE(log.find("unable to save annotations:"), std::string::npos) << log;
  EXPECT_EQ(foundAnnotations(*thumbs), Value(Dictionary{}));

  fs::remove(dbDir());
  fs::rename(aside, dbDir());
  Dictionary extension{{"n", Value(1)}};
  EXPECT_TRUE(annotate(*thumbs, {{"extension", Value(extension)}}));
  auto data = storedData();
  ASSERT_TRUE(data) << readBytes(file());
  EXPECT_EQ(*data, (Dictionary{{kThumbsId, Value(Dictionary{{"extension", Value(extension)}})}}));
}

TEST_F(AnnotationFile, ChangesMadeAfterAResetSurviveARestart) {
  writeBytes(file(), "corrupt");
  auto thumbs = startWithThumbs();
  ASSERT_TRUE(thumbs);
  ASSERT_TRUE(annotate(*thumbs, {{"election", Value(1)}}));
  ASSERT_EQ(daemon_.terminate(), 0);
  size_t logBefore = daemon_.log().size();
  ASSERT_TRUE(daemon_.start()) << daemon_.log();
  EXPECT_EQ(daemon_.log().substr(logBefore).find(kResetting), std::string::npos) << daemon_.log();
  EXPECT_EQ(foundAnnotations(*thumbs), Value(Dictionary{{"election", Value(1)}}));
  EXPECT_EQ(keptAside().size(), 1u);
}

}  // namespace
}  // namespace ek::test
