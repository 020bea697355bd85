#include "Ekora/EkBundle.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/dmap/Dmap.h"

namespace ek {
namespace {

std::string dmapText(const Value& value) {
  Result<std::string> text = dmap::write(value);
  EXPECT_TRUE(text.ok());
  return text.ok() ? *text : std::string();
}

class EkBundleTest : public ::testing::Test {
 protected:
  void SetUp() override {
    const char* base = getenv("TMPDIR");
    std::string pattern = std::string(base && *base ? base : "/tmp") + "/ekbundle-XXXXXX";
    ASSERT_NE(mkdtemp(pattern.data()), nullptr);
    // The walk compares paths lexically: work under the canonical name of the directory.
    char* real = realpath(pattern.c_str(), nullptr);
    ASSERT_NE(real, nullptr);
    root_ = real;
    free(real);
  }
  void TearDown() override {
    std::error_code ignored;
    std::filesystem::remove_all(root_, ignored);
    unsetenv("EKORA_SYSTEM_ROOT");
  }

  std::string at(const std::string& relative) const { return root_ + "/" + relative; }

  void makeDirectory(const std::string& relative) {
    std::filesystem::create_directories(at(relative));
  }
  void writeFile(const std::string& relative, const std::string& bytes) {
    std::filesystem::create_directories(std::filesystem::path(at(relative)).parent_path());
    std::ofstream out(at(relative), std::ios::binary | std::ios::trunc);
    out << bytes;
    ASSERT_TRUE(out.good());
  }
  void writeDmap(const std::string& relative, const Dictionary& dictionary) {
    writeFile(relative, dmapText(Value(dictionary)));
  }
  // A bundle directory with an info dictionary and, when named, an executable file.
  void makeBundle(const std::string& relative, const std::string& identifier,
                  const std::string& executable) {
    Dictionary info{{"QvBundleIdentifier", Value(identifier)}};
    if (!executable.empty()) {
      info["QvBundleExecutable"] = Value(executable);
      writeFile(relative + "/" + executable, "#!/bin/sh\n");
    }
    makeDirectory(relative);
    writeDmap(relative + "/Info.dmap", info);
  }

  std::string root_;
};

TEST_F(EkBundleTest, ExecutableResolvesToItsApplicationBundle) {
  makeBundle("Viewer.app", "com.example.viewer", "Viewer");
  auto bundle = EkBundle::initWithExecutablePath(at("Viewer.app/Viewer"));
  ASSERT_NE(bundle, nullptr);
  EXPECT_EQ(bundle->path(), at("Viewer.app"));
  EXPECT_EQ(bundle->executablePath(), at("Viewer.app/Viewer"));
  EXPECT_EQ(bundle->plugInsPath(), at("Viewer.app/PlugIns"));
  EXPECT_EQ(bundle->bundleIdentifier(), "com.example.viewer");
}

TEST_F(EkBundleTest, ExecutableURLResolvesLikeItsPath) {
  makeBundle("My Viewer.app", "com.example.viewer", "Viewer");
  Result<EkFileURL> url = EkFileURL::fromPath(at("My Viewer.app/Viewer"));
  ASSERT_TRUE(url.ok());
  auto fromUrl = EkBundle::initWithExecutableURL(*url);
  auto fromText = EkBundle::initWithExecutableURL(url->string());
  ASSERT_NE(fromUrl, nullptr);
  ASSERT_NE(fromText, nullptr);
  EXPECT_EQ(fromUrl->path(), at("My Viewer.app"));
  EXPECT_EQ(fromText->path(), at("My Viewer.app"));
}

TEST_F(EkBundleTest, BundleURLGivesTheBundleAndItsURL) {
  makeBundle("Viewer.app", "com.example.viewer", "Viewer");
  auto bundle = EkBundle::initWithURL(EkFileURL::fromPath(at("Viewer.app")).value().string() + "/");
  ASSERT_NE(bundle, nullptr);
  EXPECT_EQ(bundle->path(), at("Viewer.app"));
  ASSERT_TRUE(bundle->url().has_value());
  EXPECT_EQ(bundle->url()->path(), at("Viewer.app"));
}

TEST_F(EkBundleTest, NonFileURLTextGivesNoReader) {
  EXPECT_EQ(EkBundle::initWithURL("http://example.com/Viewer.app"), nullptr);
  EXPECT_EQ(EkBundle::initWithExecutableURL("not a url"), nullptr);
}

TEST_F(EkBundleTest, RelativeOrEmptyPathGivesNoReader) {
  EXPECT_EQ(EkBundle::initWithPath(""), nullptr);
  EXPECT_EQ(EkBundle::initWithPath("Viewer.app"), nullptr);
  EXPECT_EQ(EkBundle::initWithExecutablePath("bin/Viewer"), nullptr);
  EXPECT_EQ(EkBundle::initWithPath(std::string("/tmp/a\0b", 8)), nullptr);
}

TEST_F(EkBundleTest, NestedPlugInExecutableResolvesToThePlugInNotTheApplication) {
  makeBundle("Viewer.app", "com.example.viewer", "Viewer");
  makeBundle("Viewer.app/PlugIns/Thumbs.appex", "com.example.viewer.thumbs", "Thumbs");
  auto bundle = EkBundle::initWithExecutablePath(at("Viewer.app/PlugIns/Thumbs.appex/Thumbs"));
  ASSERT_NE(bundle, nullptr);
  EXPECT_EQ(bundle->path(), at("Viewer.app/PlugIns/Thumbs.appex"));
  EXPECT_EQ(bundle->bundleIdentifier(), "com.example.viewer.thumbs");
  EXPECT_EQ(bundle->containingApplicationPath(), at("Viewer.app"));
}

TEST_F(EkBundleTest, ExecutableInASubdirectoryIsFoundSeveralLevelsUp) {
  makeBundle("Tool.app", "com.example.tool", "bin/x86_64/tool");
  auto bundle = EkBundle::initWithExecutablePath(at("Tool.app/bin/x86_64/tool"));
  ASSERT_NE(bundle, nullptr);
  EXPECT_EQ(bundle->path(), at("Tool.app"));
  EXPECT_EQ(bundle->executablePath(), at("Tool.app/bin/x86_64/tool"));
}

TEST_F(EkBundleTest, AncestorNamingAnotherFileIsNotTheBundle) {
  makeBundle("Viewer.app", "com.example.viewer", "Viewer");
  writeFile("Viewer.app/Helper", "#!/bin/sh\n");
  auto bundle = EkBundle::initWithExecutablePath(at("Viewer.app/Helper"));
  ASSERT_NE(bundle, nullptr);
  // Falls back to reading the executable as a bundle directory, which it is not.
  EXPECT_FALSE(bundle->path().has_value());
  EXPECT_FALSE(bundle->executablePath().has_value());
  EXPECT_FALSE(bundle->plugInsPath().has_value());
}

TEST_F(EkBundleTest, BareDirectoryGivenAsExecutableIsReadAsABundle) {
  makeDirectory("Bare");
  auto bundle = EkBundle::initWithExecutablePath(at("Bare"));
  ASSERT_NE(bundle, nullptr);
  EXPECT_EQ(bundle->path(), at("Bare"));
  EXPECT_EQ(bundle->executablePath(), at("Bare"));
  EXPECT_EQ(bundle->plugInsPath(), at("Bare/PlugIns"));
  EXPECT_FALSE(bundle->bundleIdentifier().has_value());
  ASSERT_NE(bundle->infoDictionaryError(), nullptr);
  EXPECT_TRUE(bundle->infoDictionaryError()->isPosix(ENOENT));
}

TEST_F(EkBundleTest, BundleWithoutExecutableKeyAnswersItsOwnPath) {
  makeBundle("Data.bundle", "com.example.data", "");
  auto bundle = EkBundle::initWithPath(at("Data.bundle"));
  ASSERT_NE(bundle, nullptr);
  EXPECT_FALSE(bundle->stringProperty(EkBundleProperty::ExecutablePath).has_value());
  EXPECT_EQ(bundle->executablePath(), at("Data.bundle"));
  EXPECT_EQ(bundle->bundleIdentifier(), "com.example.data");
}

TEST_F(EkBundleTest, ExecutableKeyThatLeavesTheBundleIsIgnored) {
  const std::vector<Value> names = {Value("../Other"),
                                    Value("/bin/sh"),
                                    Value("a//b"),
                                    Value("./Viewer"),
                                    Value(""),
                                    Value(uint64_t{7}),
                                    Value(std::string(2000, 'x'))};
  for (const Value& name : names) {
    makeDirectory("Odd.app");
    writeDmap("Odd.app/Info.dmap", {{"QvBundleExecutable", name}});
    auto bundle = EkBundle::initWithPath(at("Odd.app"));
    ASSERT_NE(bundle, nullptr);
    EXPECT_EQ(bundle->executablePath(), at("Odd.app")) << name.description();
  }
}

TEST_F(EkBundleTest, MissingPathAnswersNothing) {
  auto bundle = EkBundle::initWithPath(at("Nowhere.app"));
  ASSERT_NE(bundle, nullptr);
  EXPECT_FALSE(bundle->path().has_value());
  EXPECT_FALSE(bundle->url().has_value());
  EXPECT_FALSE(bundle->executablePath().has_value());
  EXPECT_FALSE(bundle->supportPath().has_value());
  EXPECT_FALSE(bundle->plugInsPath().has_value());
  EXPECT_FALSE(bundle->bundleIdentifier().has_value());
  EXPECT_EQ(bundle->infoDictionary(), nullptr);
  EXPECT_TRUE(bundle->localizations().empty());
}

TEST_F(EkBundleTest, MalformedInfoDmapGivesNoInfoAndAFormatError) {
  const std::vector<std::string> bodies = {
      "",
      "not xml at all",
      "<?xml version=\"1.0\"?><dmap version=\"1.0\"><dict><key>a</key></dict></dmap>",
      "<?xml version=\"1.0\"?><dmap version=\"1.0\"><array><string>x</string></array></dmap>",
      "<?xml version=\"1.0\"?><dmap version=\"1.0\"><dict><key>QvBundleExecutable</key>"
      "<string>Viewer</string><key>QvBundleExecutable</key><string>Other</string></dict></dmap>",
      std::string("<?xml version=\"1.0\"?><dmap version=\"1.0\">") + std::string(600, 'x'),
  };
  for (const std::string& body : bodies) {
    writeFile("Broken.app/Info.dmap", body);
    writeFile("Broken.app/Viewer", "#!/bin/sh\n");
    auto bundle = EkBundle::initWithPath(at("Broken.app"));
    ASSERT_NE(bundle, nullptr);
    EXPECT_EQ(bundle->path(), at("Broken.app"));
    EXPECT_EQ(bundle->infoDictionary(), nullptr) << body;
    EXPECT_NE(bundle->infoDictionaryError(), nullptr) << body;
    EXPECT_FALSE(bundle->bundleIdentifier().has_value());
    EXPECT_EQ(bundle->executablePath(), at("Broken.app"));
    // The executable cannot be traced back to a bundle with a broken info dictionary.
    auto fromExecutable = EkBundle::initWithExecutablePath(at("Broken.app/Viewer"));
    ASSERT_NE(fromExecutable, nullptr);
    EXPECT_FALSE(fromExecutable->path().has_value());
  }
}

TEST_F(EkBundleTest, HugeInfoDmapIsRefusedBeforeReading) {
  makeDirectory("Huge.app");
  std::string padding = dmapText(Value(Dictionary{{"QvBundleIdentifier", Value("x")}}));
  padding.append(bundle::kMaxInfoFileSize, ' ');
  writeFile("Huge.app/Info.dmap", padding);
  auto bundle = EkBundle::initWithPath(at("Huge.app"));
  ASSERT_NE(bundle, nullptr);
  EXPECT_EQ(bundle->infoDictionary(), nullptr);
  ASSERT_NE(bundle->infoDictionaryError(), nullptr);
  EXPECT_TRUE(bundle->infoDictionaryError()->isPosix(EFBIG));
}

TEST_F(EkBundleTest, InfoDmapThatIsADirectoryOrFifoIsRefused) {
  makeDirectory("Dir.app/Info.dmap");
  auto directory = EkBundle::initWithPath(at("Dir.app"));
  ASSERT_NE(directory, nullptr);
  EXPECT_EQ(directory->infoDictionary(), nullptr);
  EXPECT_NE(directory->infoDictionaryError(), nullptr);

  makeDirectory("Fifo.app");
  ASSERT_EQ(mkfifo(at("Fifo.app/Info.dmap").c_str(), 0600), 0);
  auto fifo = EkBundle::initWithPath(at("Fifo.app"));  // must not block
  ASSERT_NE(fifo, nullptr);
  EXPECT_EQ(fifo->infoDictionary(), nullptr);
  EXPECT_NE(fifo->infoDictionaryError(), nullptr);
}

TEST_F(EkBundleTest, SymlinkLoopInTheAncestorWalkIsSkipped) {
  makeBundle("Loop.app", "com.example.loop", "bin/tool");
  // The nearer ancestor's Info.dmap is a link to itself; the walk carries on above it.
  ASSERT_EQ(symlink("Info.dmap", at("Loop.app/bin/Info.dmap").c_str()), 0);
  auto bundle = EkBundle::initWithExecutablePath(at("Loop.app/bin/tool"));
  ASSERT_NE(bundle, nullptr);
  EXPECT_EQ(bundle->path(), at("Loop.app"));
}

TEST_F(EkBundleTest, SymlinkLoopAsTheExecutableAnswersNothing) {
  makeDirectory("Cycle");
  ASSERT_EQ(symlink("b", at("Cycle/a").c_str()), 0);
  ASSERT_EQ(symlink("a", at("Cycle/b").c_str()), 0);
  auto bundle = EkBundle::initWithExecutablePath(at("Cycle/a/tool"));
  ASSERT_NE(bundle, nullptr);
  EXPECT_FALSE(bundle->path().has_value());
}

TEST_F(EkBundleTest, WalkStopsAfterItsDepthBound) {
  // A link to "." lets a path grow without bound while naming the same directory.
  makeBundle("Deep.app", "com.example.deep", "");
  ASSERT_EQ(symlink(".", at("Deep.app/self").c_str()), 0);
  std::string relative = "Deep.app";
  for (size_t i = 0; i < bundle::kMaxExecutableSearchDepth + 4; ++i) relative += "/self";
  const std::string executable = relative + "/tool";
  writeFile("Deep.app/tool", "#!/bin/sh\n");
  writeDmap("Deep.app/Info.dmap",
            {{"QvBundleExecutable", Value(executable.substr(std::string("Deep.app/").size()))}});
  auto tooDeep = EkBundle::initWithExecutablePath(at(executable));
  ASSERT_NE(tooDeep, nullptr);
  EXPECT_FALSE(tooDeep->path().has_value());

  std::string shallow = "Deep.app";
  for (size_t i = 0; i + 1 < bundle::kMaxExecutableSearchDepth; ++i) shallow += "/self";
  writeDmap(
      "Deep.app/Info.dmap",
      {{"QvBundleExecutable", Value(shallow.substr(std::string("Deep.app/").size()) + "/tool")}});
  auto withinBound = EkBundle::initWithExecutablePath(at(shallow + "/tool"));
  ASSERT_NE(withinBound, nullptr);
  EXPECT_EQ(withinBound->path(), at("Deep.app"));
}

TEST_F(EkBundleTest, SupportPathIsTheBundleDirectory) {
  makeBundle("Viewer.app", "com.example.viewer", "Viewer");
  auto bundle = EkBundle::initWithPath(at("Viewer.app"));
  ASSERT_NE(bundle, nullptr);
  EXPECT_EQ(bundle->supportPath(), at("Viewer.app"));
  EXPECT_EQ(bundle->supportPath(), at("Viewer.app"));
  EXPECT_EQ(bundle->bundleDirectory("Resources"), at("Viewer.app/Resources"));
}

TEST_F(EkBundleTest, ConcurrentFirstSupportPathCallsAgree) {
  makeBundle("Viewer.app", "com.example.viewer", "Viewer");
  auto bundle = EkBundle::initWithPath(at("Viewer.app"));
  ASSERT_NE(bundle, nullptr);
  std::vector<std::optional<std::string>> answers(8);
  std::vector<std::thread> threads;
  for (size_t i = 0; i < answers.size(); ++i) {
    threads.emplace_back([&, i] { answers[i] = bundle->plugInsPath(); });
  }
  for (auto& thread : threads) thread.join();
  for (const auto& answer : answers) EXPECT_EQ(answer, at("Viewer.app/PlugIns"));
}

TEST_F(EkBundleTest, PathIsNormalized) {
  makeBundle("Viewer.app", "com.example.viewer", "Viewer");
  auto bundle = EkBundle::initWithPath(root_ + "//./Viewer.app///");
  ASSERT_NE(bundle, nullptr);
  EXPECT_EQ(bundle->path(), at("Viewer.app"));
}

TEST_F(EkBundleTest, LocalizedStringsTablesAreReadPerLanguage) {
  makeBundle("Viewer.app", "com.example.viewer", "Viewer");
  writeDmap("Viewer.app/Info.dmap", {{"QvBundleIdentifier", Value("com.example.viewer")},
                                     {"QvBundleDisplayName", Value("Viewer")},
                                     {"QvBundleName", Value("viewer")}});
  writeDmap("Viewer.app/de.lproj/InfoDmap.strings", {{"QvBundleDisplayName", Value("Betrachter")}});
  writeDmap("Viewer.app/de.lproj/Localizable.strings", {{"Open", Value("Öffnen")}});
  writeDmap("Viewer.app/fr.lproj/Localizable.strings",
            {{"Open", Value("Ouvrir")}, {"Count", Value(uint64_t{3})}});
  writeFile("Viewer.app/notalanguage.lproj", "a file, not a directory");
  auto bundle = EkBundle::initWithPath(at("Viewer.app"));
  ASSERT_NE(bundle, nullptr);

  EXPECT_EQ(bundle->localizations(), (std::vector<std::string>{"de", "fr"}));
  Result<Dictionary> german = bundle->stringsTable(bundle::kDefaultStringsTable, "de");
  ASSERT_TRUE(german.ok());
  EXPECT_EQ(german->at("Open"), Value("Öffnen"));

  const std::vector<std::string> frenchFirst = {"fr", "de"};
  const std::vector<std::string> italianFirst = {"it", "de"};
  EXPECT_EQ(bundle->localizedString("Open", "Localizable", frenchFirst), "Ouvrir");
  EXPECT_EQ(bundle->localizedString("Open", "Localizable", italianFirst), "Öffnen");
  // A value that is not a string is passed over for the next language.
  const std::vector<std::string> countLanguages = {"fr"};
  EXPECT_FALSE(bundle->localizedString("Count", "Localizable", countLanguages).has_value());

  EXPECT_EQ(bundle->localizedInfoString("QvBundleDisplayName", italianFirst), "Betrachter");
  EXPECT_EQ(bundle->localizedInfoString("QvBundleDisplayName", frenchFirst), "Betrachter");
  const std::vector<std::string> english = {"en"};
  EXPECT_EQ(bundle->localizedInfoString("QvBundleDisplayName", english), "Viewer");
  EXPECT_EQ(bundle->localizedInfoString("QvBundleName", english), "viewer");
}

TEST_F(EkBundleTest, StringsTableRefusesNamesThatLeaveTheBundle) {
  makeBundle("Viewer.app", "com.example.viewer", "Viewer");
  writeDmap("secret.lproj/Localizable.strings", {{"k", Value("v")}});
  auto bundle = EkBundle::initWithPath(at("Viewer.app"));
  ASSERT_NE(bundle, nullptr);
  for (const char* language : {"../../secret", "..", ".", "", "de/.."}) {
    Result<Dictionary> table = bundle->stringsTable("Localizable", language);
    ASSERT_FALSE(table.ok()) << language;
    EXPECT_TRUE(table.error().isPosix(EINVAL)) << language;
  }
  EXPECT_TRUE(bundle->stringsTable("../Info", "de").error().isPosix(EINVAL));
  EXPECT_TRUE(bundle->stringsTable("Localizable", "de").error().isPosix(ENOENT));
}

TEST_F(EkBundleTest, MalformedStringsTableIsAFormatError) {
  makeBundle("Viewer.app", "com.example.viewer", "Viewer");
  writeFile("Viewer.app/de.lproj/Localizable.strings", "<dmap version=\"1.0\"><dict>");
  writeFile("Viewer.app/fr.lproj/Localizable.strings",
            dmapText(Value(Array{Value("not"), Value("a dictionary")})));
  auto bundle = EkBundle::initWithPath(at("Viewer.app"));
  ASSERT_NE(bundle, nullptr);
  Result<Dictionary> german = bundle->stringsTable("Localizable", "de");
  ASSERT_FALSE(german.ok());
  EXPECT_EQ(german.error().domain, kFormatErrorDomain);
  Result<Dictionary> french = bundle->stringsTable("Localizable", "fr");
  ASSERT_FALSE(french.ok());
  EXPECT_EQ(french.error().domain, kFormatErrorDomain);
  const std::vector<std::string> languages = {"de", "fr"};
  EXPECT_FALSE(bundle->localizedString("k", "Localizable", languages).has_value());
}

struct ContainingCase {
  const char* plugInPath;
  std::optional<std::string> application;
};

TEST(EkBundleContainingApplication, IsTwoLevelsUpOnlyDirectlyInAnAppsPlugIns) {
  const std::vector<ContainingCase> cases = {
      {"/apps/Viewer.app/PlugIns/Thumbs.appex", "/apps/Viewer.app"},
      {"/apps/Viewer.app/PlugIns/Thumbs.appex/", "/apps/Viewer.app"},
      {"/apps/Viewer.app//PlugIns/./Thumbs.appex", "/apps/Viewer.app"},
      {"/apps/Viewer.app/PlugIns/Nested.appex/PlugIns/Deep.appex", std::nullopt},
      {"/apps/Viewer.app/PlugIns/Thumbs.appex/PlugIns/Deep.appex", std::nullopt},
      {"/apps/Viewer.app/Contents/PlugIns/Thumbs.appex", std::nullopt},
      {"/apps/Viewer.bundle/PlugIns/Thumbs.appex", std::nullopt},
      {"/apps/Viewer.app/plugins/Thumbs.appex", std::nullopt},
      {"/.app/PlugIns/Thumbs.appex", std::nullopt},
      {"/PlugIns/Thumbs.appex", std::nullopt},
      {"/System/Library/PlugIns/Thumbs.appex", std::nullopt},
      {"relative/Viewer.app/PlugIns/Thumbs.appex", std::nullopt},
      {"", std::nullopt},
  };
  for (const ContainingCase& c : cases) {
    EXPECT_EQ(containingApplicationPath(c.plugInPath), c.application) << c.plugInPath;
  }
}

TEST_F(EkBundleTest, SystemVolumeFollowsTheConfiguredRoot) {
  setenv("EKORA_SYSTEM_ROOT", at("System").c_str(), 1);
  makeBundle("System/Library/PlugIns/Sys.plugin", "com.example.sys", "Sys");
  makeBundle("SystemOther/Thing.appex", "com.example.other", "Thing");
  auto system = EkBundle::initWithPath(at("System/Library/PlugIns/Sys.plugin"));
  auto other = EkBundle::initWithPath(at("SystemOther/Thing.appex"));
  auto missing = EkBundle::initWithPath(at("System/Library/PlugIns/Missing.plugin"));
  ASSERT_NE(system, nullptr);
  ASSERT_NE(other, nullptr);
  ASSERT_NE(missing, nullptr);
  EXPECT_TRUE(system->isOnSystemVolume());
  EXPECT_FALSE(other->isOnSystemVolume());
  EXPECT_FALSE(missing->isOnSystemVolume());
  EXPECT_FALSE(isOnSystemVolume(at("System")));
  EXPECT_EQ(systemPlugInsPath(), at("System/Library/PlugIns"));
}

}  // namespace
}  // namespace ek
