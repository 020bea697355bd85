#include "platform/types/TypeSystem.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <limits>
#include <string>

#include "platform/dmap/Dmap.h"

namespace ek::types {
namespace {

namespace fs = std::filesystem;

class TypeSystemFiles : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/ektypes-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    dir_ = pattern;
  }
  void TearDown() override {
    std::error_code ignored;
    fs::remove_all(dir_, ignored);
  }

  void writeTypes(const std::string& name, const Dictionary& declarations) {
    ASSERT_TRUE(dmap::writeFileAtomically((dir_ / name).string(), Value(declarations)).ok());
  }
  void writeRaw(const std::string& name, const std::string& bytes) {
    std::ofstream(dir_ / name) << bytes;
  }
  std::shared_ptr<TypeSystem> load() { return TypeSystem::loadFrom(dir_.string()); }

  fs::path dir_;
};

// ---- Conformance -----------------------------------------------------------------------------

struct ConformanceCase {
  const char* type;
  const char* supertype;
  bool conforms;
};

TEST(TypeSystem, CompiledInConformance) {
  const ConformanceCase cases[] = {
      {"public.jpeg", "public.jpeg", true},
      {"public.jpeg", "public.image", true},
      {"public.jpeg", "public.data", true},
      {"public.jpeg", "public.content", true},
      {"public.jpeg", "public.item", true},
      {"public.image", "public.jpeg", false},
      {"public.data", "public.image", false},
      {"public.jpeg", "public.png", false},
      {"public.jpeg", "public.text", false},
      {"public.utf8-plain-text", "public.text", true},
      {"public.json", "public.text", true},
      {"public.html", "public.plain-text", false},
      {"public.mp3", "public.audio", true},
      {"public.mpeg-4", "public.movie", true},
      {"public.mpeg-4", "public.audio", false},
      {"public.quicktime-movie", "public.audiovisual-content", true},
      {"org.gnu.gnu-zip-archive", "public.archive", true},
      {"public.zip-archive", "public.data", true},
      {"public.file-url", "public.url", true},
      {"public.folder", "public.directory", true},
      {"public.folder", "public.data", false},
      {"com.adobe.pdf", "public.composite-content", true},
      {"com.adobe.pdf", "public.content", true},
      {"public.contact", "public.item", true},
      {"public.calendar-event", "public.item", true},
      {"public.svg-image", "public.xml", true},
      {"public.svg-image", "public.image", true},
      {"public.item", "public.data", false},
      {"com.example.unknown", "com.example.unknown", true},
      {"com.example.unknown", "public.item", false},
      {"public.jpeg", "com.example.unknown", false},
  };
  TypeSystem types;
  for (const ConformanceCase& c : cases) {
    EXPECT_EQ(types.conforms(c.type, c.supertype), c.conforms)
        << c.type << " conforms to " << c.supertype;
  }
}

TEST(TypeSystem, ParentsOfCompiledInTypes) {
  TypeSystem types;
  EXPECT_EQ(types.parents("public.jpeg"), std::vector<std::string>{"public.image"});
  EXPECT_EQ(types.parents("public.image"),
            (std::vector<std::string>{"public.data", "public.content"}));
  EXPECT_TRUE(types.parents("public.item").empty());
  EXPECT_TRUE(types.parents("com.example.unknown").empty());
}

TEST(TypeSystem, AncestorsAreVisitedOnceNearestFirst) {
  TypeSystem types;
  std::vector<std::string> seen;
  types.forEachAncestor("public.svg-image", [&](std::string_view t) { seen.emplace_back(t); });
  // public.data and public.content are reached both through public.image and public.xml.
  EXPECT_EQ(seen, (std::vector<std::string>{"public.svg-image", "public.image", "public.xml",
                                            "public.data", "public.content", "public.text",
                                            "public.item"}));
  seen.clear();
  types.forEachAncestor("com.example.unknown", [&](std::string_view t) { seen.emplace_back(t); });
  EXPECT_EQ(seen, std::vector<std::string>{"com.example.unknown"});
}

TEST_F(TypeSystemFiles, FilesExtendTheHierarchy) {
  writeTypes("camera.dmap", Dictionary{{"com.example.raw", Array{"public.image"}},
                                       {"com.example.raw-nikon", Array{"com.example.raw"}}});
  writeTypes("more.dmap", Dictionary{{"public.png", Array{"com.example.lossless"}},
                                     {"com.example.lossless", Array{"public.data"}}});
  auto types = load();
  EXPECT_TRUE(types->conforms("com.example.raw-nikon", "public.image"));
  EXPECT_TRUE(types->conforms("com.example.raw-nikon", "public.item"));
  EXPECT_FALSE(types->conforms("public.image", "com.example.raw"));
  // A file adds parents to a compiled-in type without taking its own away.
  EXPECT_TRUE(types->conforms("public.png", "com.example.lossless"));
  EXPECT_TRUE(types->conforms("public.png", "public.image"));
  EXPECT_EQ(types->parents("public.png"),
            (std::vector<std::string>{"public.image", "com.example.lossless"}));
}

TEST_F(TypeSystemFiles, MissingDirectoryGivesTheCompiledInHierarchy) {
  auto types = TypeSystem::loadFrom((dir_ / "absent").string());
  ASSERT_NE(types, nullptr);
  EXPECT_TRUE(types->conforms("public.jpeg", "public.image"));
}

TEST_F(TypeSystemFiles, BadFilesAreSkippedAndGoodOnesKept) {
  writeRaw("broken.dmap", "<dmap version=\"1.0\"><dict><key>com.example.a</key>");
  ASSERT_TRUE(
      dmap::writeFileAtomically((dir_ / "root-array.dmap").string(), Value(Array{"x"})).ok());
  writeTypes("parent-not-string.dmap", Dictionary{{"com.example.b", Array{"public.data", 7}},
                                                  {"com.example.c", Array{"public.data"}}});
  writeTypes("parents-not-array.dmap", Dictionary{{"com.example.d", "public.data"}});
  Array tooMany;
  for (int i = 0; i < 65; ++i) tooMany.emplace_back("com.example.p" + std::to_string(i));
  writeTypes("too-many-parents.dmap", Dictionary{{"com.example.e", tooMany}});
  writeTypes("good.dmap", Dictionary{{"com.example.good", Array{"public.text"}}});
  writeTypes("ignored.txt", Dictionary{{"com.example.txt", Array{"public.text"}}});

  auto types = load();
  EXPECT_TRUE(types->conforms("com.example.good", "public.text"));
  // A file with one bad entry is skipped whole, good entries included.
  EXPECT_FALSE(types->conforms("com.example.c", "public.data"));
  EXPECT_FALSE(types->conforms("com.example.b", "public.data"));
  EXPECT_FALSE(types->conforms("com.example.d", "public.data"));
  EXPECT_TRUE(types->parents("com.example.e").empty());
  EXPECT_FALSE(types->conforms("com.example.txt", "public.text"));
}

TEST_F(TypeSystemFiles, EdgesThatWouldMakeACycleAreIgnored) {
  writeTypes("a.dmap", Dictionary{{"com.example.a", Array{"com.example.b"}},
                                  {"com.example.b", Array{"com.example.c"}}});
  // Sorted after a.dmap: c -> a would close a -> b -> c -> a; c -> public.data is fine.
  writeTypes("b.dmap", Dictionary{{"com.example.c", Array{"com.example.a", "public.data"}},
                                  {"com.example.self", Array{"com.example.self"}},
                                  {"public.data", Array{"public.jpeg"}}});
  auto types = load();
  EXPECT_TRUE(types->conforms("com.example.a", "com.example.c"));
  EXPECT_TRUE(types->conforms("com.example.a", "public.item"));
  EXPECT_FALSE(types->conforms("com.example.c", "com.example.a"));
  EXPECT_EQ(types->parents("com.example.c"), std::vector<std::string>{"public.data"});
  EXPECT_TRUE(types->parents("com.example.self").empty());
  EXPECT_FALSE(types->conforms("public.data", "public.jpeg"));
  EXPECT_TRUE(types->conforms("public.jpeg", "public.data"));
  // Asking about types that are not related still terminates.
  EXPECT_FALSE(types->conforms("com.example.c", "com.example.missing"));
}

TEST_F(TypeSystemFiles, DeepChainConformsEndToEnd) {
  Dictionary chain;
  for (int i = 1; i < 2000; ++i) {
    chain.emplace("com.example.t" + std::to_string(i),
                  Array{"com.example.t" + std::to_string(i - 1)});
  }
  chain.emplace("com.example.t0", Array{"public.data"});
  writeTypes("chain.dmap", chain);
  auto types = load();
  EXPECT_TRUE(types->conforms("com.example.t1999", "public.item"));
  EXPECT_FALSE(types->conforms("com.example.t0", "com.example.t1999"));
}

TEST(TypeSystem, SystemLoadsOnceFromTheSystemRoot) {
  auto first = TypeSystem::system();
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(first, TypeSystem::system());
  EXPECT_TRUE(first->conforms("public.png", "public.image"));
}

// ---- Activation rules ------------------------------------------------------------------------

struct RuleCase {
  const char* name;
  Value rule;
  Dictionary items;
  bool accepts;
};

TEST(TypeSystem, ActivationRules) {
  const double huge = 1e30;
  const RuleCase cases[] = {
      {"true takes any number", Dictionary{{"public.image", true}},
       Dictionary{{"public.jpeg", 1000000}}, true},
      {"false is not a limit", Dictionary{{"public.image", false}}, Dictionary{{"public.jpeg", 1}},
       false},
      {"within limit", Dictionary{{"public.image", 3}}, Dictionary{{"public.jpeg", 3}}, true},
      {"over limit", Dictionary{{"public.image", 3}}, Dictionary{{"public.jpeg", 4}}, false},
      {"conforming types add up", Dictionary{{"public.image", 3}},
       Dictionary{{"public.jpeg", 2}, {"public.png", 2}}, false},
      {"exact type counts", Dictionary{{"public.jpeg", 1}}, Dictionary{{"public.jpeg", 1}}, true},
      {"host type conforming to no rule type", Dictionary{{"public.image", 5}},
       Dictionary{{"public.jpeg", 1}, {"public.plain-text", 1}}, false},
      {"unknown host type", Dictionary{{"public.item", true}},
       Dictionary{{"com.example.unknown", 1}}, false},
      {"zero count needs no rule type", Dictionary{{"public.image", 5}},
       Dictionary{{"public.jpeg", 1}, {"public.plain-text", 0}}, true},
      {"each rule type counts separately", Dictionary{{"public.image", 1}, {"public.text", 2}},
       Dictionary{{"public.jpeg", 1}, {"public.html", 1}, {"public.json", 1}}, true},
      {"second rule type over its limit", Dictionary{{"public.image", 1}, {"public.text", 1}},
       Dictionary{{"public.jpeg", 1}, {"public.html", 1}, {"public.json", 1}}, false},
      {"item counted under every rule type it conforms to",
       Dictionary{{"public.image", 5}, {"public.data", 1}}, Dictionary{{"public.jpeg", 2}}, false},
      {"zero limit", Dictionary{{"public.image", 0}}, Dictionary{{"public.jpeg", 1}}, false},
      {"zero limit and no items of it", Dictionary{{"public.image", 0}, {"public.text", 1}},
       Dictionary{{"public.html", 1}}, true},
      {"negative limit", Dictionary{{"public.image", -1}}, Dictionary{{"public.jpeg", 1}}, false},
      {"double limit rounds down", Dictionary{{"public.image", 2.9}},
       Dictionary{{"public.jpeg", 2}}, true},
      {"double limit exceeded", Dictionary{{"public.image", 2.9}}, Dictionary{{"public.jpeg", 3}},
       false},
      {"huge double limit", Dictionary{{"public.image", huge}},
       Dictionary{{"public.jpeg", std::numeric_limits<uint64_t>::max()}}, true},
      {"nan limit", Dictionary{{"public.image", std::numeric_limits<double>::quiet_NaN()}},
       Dictionary{{"public.jpeg", 1}}, false},
      {"largest limit", Dictionary{{"public.image", std::numeric_limits<uint64_t>::max()}},
       Dictionary{{"public.jpeg", std::numeric_limits<uint64_t>::max()}}, true},
      {"counts saturate instead of wrapping",
       Dictionary{{"public.image", std::numeric_limits<uint64_t>::max() - 1}},
       Dictionary{{"public.jpeg", std::numeric_limits<uint64_t>::max()}, {"public.png", 2}}, false},
      {"string limit", Dictionary{{"public.image", "3"}}, Dictionary{{"public.jpeg", 1}}, false},
      {"negative count", Dictionary{{"public.image", true}}, Dictionary{{"public.jpeg", -1}},
       false},
      {"string count", Dictionary{{"public.image", true}}, Dictionary{{"public.jpeg", "1"}}, false},
      {"empty items", Dictionary{{"public.image", 1}}, Dictionary{}, true},
      {"empty rule with items", Dictionary{}, Dictionary{{"public.jpeg", 1}}, false},
      {"rule that is true", Value(true), Dictionary{{"public.jpeg", 1}}, false},
      {"rule that is a string", Value("public.image"), Dictionary{{"public.jpeg", 1}}, false},
      {"rule that is an array", Value(Array{"public.image"}), Dictionary{{"public.jpeg", 1}},
       false},
  };
  TypeSystem types;
  for (const RuleCase& c : cases) {
    EXPECT_EQ(types.evaluateActivationRule(c.rule, c.items), c.accepts) << c.name;
  }
}

TEST_F(TypeSystemFiles, ActivationRulesFollowDeclaredTypes) {
  writeTypes("raw.dmap", Dictionary{{"com.example.raw", Array{"public.image"}}});
  auto types = load();
  const Value rule = Dictionary{{"public.image", 1}};
  EXPECT_TRUE(types->evaluateActivationRule(rule, Dictionary{{"com.example.raw", 1}}));
  EXPECT_FALSE(TypeSystem().evaluateActivationRule(rule, Dictionary{{"com.example.raw", 1}}));
}

TEST(TypeSystem, LargeItemDescriptionAnswers) {
  Dictionary items;
  for (int i = 0; i < 20000; ++i) items.emplace("com.example.t" + std::to_string(i), 1);
  Dictionary rule;
  for (int i = 0; i < 20000; ++i) rule.emplace("com.example.t" + std::to_string(i), 1);
  TypeSystem types;
  EXPECT_TRUE(types.evaluateActivationRule(rule, items));
  items.emplace("com.example.other", 1);
  EXPECT_FALSE(types.evaluateActivationRule(rule, items));
}

}  // namespace
}  // namespace ek::types
