#include "Ekora/EkBundle.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "platform/dmap/Dmap.h"
#include "platform/testing/Files.h"

namespace ek {
namespace {

namespace fs = std::filesystem;

class EkBundleTest : public ::testing::Test {
 protected:
  std::string at(const std::string& relative) const { return root_ + "/" + relative; }
  void write(const std::string& relative, std::string_view bytes) {
    ASSERT_TRUE(testing::writeFile(at(relative), bytes));
  }
  void writeDmap(const std::string& relative, const Dictionary& dictionary) {
    write(relative, dmap::write(Value(dictionary)).value());
  }
  // A bundle directory whose info names an executable, which is made too.
  void makeBundle(const std::string& relative, const std::string& executable) {
    writeDmap(relative + "/Info.dmap", {{"QvBundleIdentifier", "com.example." + relative},
                                        {"QvBundleExecutable", executable}});
    write(relative + "/" + executable, "#!/bin/sh\n");
  }

  testing::TempDir temp_;
  // The walk compares paths lexically: work under the canonical name of the directory.
  const std::string root_ = fs::canonical(temp_.path()).string();
};

// Each executable resolves to the nearest ancestor (within the depth bound) whose info names
// it, else is read as a bundle directory itself.
TEST_F(EkBundleTest, ExecutableResolvesToTheBundleDeclaringIt) {
  makeBundle("Viewer.app", "Viewer");
  makeBundle("Viewer.app/PlugIns/Thumbs.appex", "Thumbs");
  makeBundle("Tool.app", "bin/x86_64/tool");
  write("Viewer.app/Helper", "");
  fs::create_directories(at("Bare"));
  fs::create_symlink("Info.dmap", at("Tool.app/bin/Info.dmap"));  // a loop the walk passes
  fs::create_symlink("b", at("Bare/a"));
  fs::create_symlink("a", at("Bare/b"));
  // A link to "." lets a path grow without bound while naming the same directory.
  std::string near = "tool";
  while (near.size() < 5 * (bundle::kMaxExecutableSearchDepth - 1)) near = "self/" + near;
  const std::string deep = "self/" + near;
  for (const auto& [name, executable] : {std::pair{"Near.app", near}, {"Deep.app", deep}}) {
    fs::create_directories(at(name));
    fs::create_symlink(".", at(std::string(name) + "/self"));
    makeBundle(name, executable);
  }
  const std::pair<std::string, std::optional<std::string>> rows[] = {
      {"Viewer.app/PlugIns/Thumbs.appex/Thumbs", "Viewer.app/PlugIns/Thumbs.appex"},
      {"Tool.app/bin/x86_64/tool", "Tool.app"},
      {"Viewer.app/Helper", std::nullopt},
      {"Bare", "Bare"},
      {"Bare/a/tool", std::nullopt},
      {"Near.app/" + near, "Near.app"},
      {"Deep.app/" + deep, std::nullopt},
  };
  for (const auto& [executable, bundle] : rows) {
    SCOPED_TRACE(executable);
    auto reader = EkBundle::initWithExecutablePath(at(executable));
    ASSERT_NE(reader, nullptr);
    EXPECT_EQ(reader->path(), bundle ? std::optional(at(*bundle)) : std::nullopt);
    EXPECT_EQ(reader->executablePath(), bundle ? std::optional(at(executable)) : std::nullopt);
  }
  EXPECT_EQ(
      EkBundle::initWithExecutableURL("file://" + at("Viewer.app/Viewer"))->bundleIdentifier(),
      "com.example.Viewer.app");
  EXPECT_EQ(EkBundle::initWithPath("Viewer.app"), nullptr);
  EXPECT_EQ(EkBundle::initWithURL("http://example.com/Viewer.app"), nullptr);
}

TEST_F(EkBundleTest, ExecutableNameThatLeavesTheBundleIsIgnored) {
  for (const Value& name : {Value("../Other"), Value("/bin/sh"), Value("a//b"), Value("./Viewer"),
                            Value(""), Value(7), Value(std::string(2000, 'x'))}) {
    writeDmap("Odd.app/Info.dmap", {{"QvBundleExecutable", name}});
    EXPECT_EQ(EkBundle::initWithPath(at("Odd.app"))->executablePath(), at("Odd.app"))
        << name.description();
  }
}

TEST_F(EkBundleTest, UnreadableInfoGivesNoInfoAndTheReason) {
  const std::string huge = dmap::write(Value(Dictionary{{"QvBundleIdentifier", "x"}})).value() +
                           std::string(bundle::kMaxInfoFileSize, ' ');
  const std::pair<std::string, std::optional<std::string>> rows[] = {
      {"Empty.app", ""},
      {"Huge.app", huge},
      {"Directory.app", std::nullopt},
      {"Fifo.app", std::nullopt},
  };
  for (const auto& [name, body] : rows) {
    SCOPED_TRACE(name);
    if (body) write(name + "/Info.dmap", *body);
    if (name == "Directory.app") fs::create_directories(at(name + "/Info.dmap"));
    write(name + "/V", "");
    ASSERT_TRUE(name != "Fifo.app" || mkfifo(at(name + "/Info.dmap").c_str(), 0600) == 0);
    auto bundle = EkBundle::initWithPath(at(name));  // must not block on the fifo
    EXPECT_EQ(bundle->path(), at(name));
    EXPECT_EQ(bundle->infoDictionary(), nullptr);
    ASSERT_NE(bundle->infoDictionaryError(), nullptr);
    EXPECT_TRUE(name != "Huge.app" || bundle->infoDictionaryError()->isPosix(EFBIG));
    EXPECT_FALSE(EkBundle::initWithExecutablePath(at(name + "/V"))->path().has_value());
  }
}

TEST_F(EkBundleTest, StringsTablesAreReadPerLanguageBeneathTheBundle) {
  writeDmap("Viewer.app/Info.dmap", {{"QvBundleDisplayName", "Viewer"}});
  writeDmap("Viewer.app/de.lproj/InfoDmap.strings", {{"QvBundleDisplayName", "Betrachter"}});
  writeDmap("Viewer.app/de.lproj/Localizable.strings", {{"Open", "Öffnen"}});
  writeDmap("secret.lproj/Localizable.strings", {{"Open", "v"}});
  auto bundle = EkBundle::initWithPath(at("Viewer.app"));
  EXPECT_EQ(bundle->localizations(), (std::vector<std::string>{"de"}));
  using Languages = std::vector<std::string>;
  EXPECT_EQ(bundle->localizedString("Open", "Localizable", Languages{"it", "es", "de"}), "Öffnen");
  EXPECT_EQ(bundle->localizedInfoString("QvBundleDisplayName", Languages{"de"}), "Betrachter");
  EXPECT_EQ(bundle->localizedInfoString("QvBundleDisplayName", Languages{"en"}), "Viewer");
  for (const char* language : {"../../secret", "..", ".", "", "de/.."}) {
    EXPECT_TRUE(bundle->stringsTable("Localizable", language).error().isPosix(EINVAL)) << language;
  }
  EXPECT_TRUE(bundle->stringsTable("../Info", "de").error().isPosix(EINVAL));
}

TEST(EkBundleContainingApplication, IsTwoLevelsUpOnlyDirectlyInAnAppsPlugIns) {
  const std::pair<const char*, std::optional<std::string>> rows[] = {
      {"/apps/Viewer.app/PlugIns/Thumbs.appex", "/apps/Viewer.app"},
      {"/apps/Viewer.app//PlugIns/./Thumbs.appex/", "/apps/Viewer.app"},
      {"/apps/Viewer.app/PlugIns/Thumbs.appex/PlugIns/Deep.appex", std::nullopt},
      {"/apps/Viewer.bundle/PlugIns/Thumbs.appex", std::nullopt},
      {"/apps/Viewer.app/plugins/Thumbs.appex", std::nullopt},
      {"relative/Viewer.app/PlugIns/Thumbs.appex", std::nullopt},
  };
  for (const auto& [path, application] : rows) {
    EXPECT_EQ(containingApplicationPath(path), application) << path;
  }
}

}  // namespace
}  // namespace ek
