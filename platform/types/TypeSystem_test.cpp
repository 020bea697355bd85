#include "platform/types/TypeSystem.h"

#include <gtest/gtest.h>

#include <limits>

#include "platform/dmap/Dmap.h"
#include "platform/testing/Files.h"

namespace ek::types {
namespace {

using Types = std::vector<std::string>;

TEST(TypeSystem, TypeConformsToItselfAndEachAncestorOnceNearestFirst) {
  TypeSystem types;
  Types seen;
  types.forEachAncestor("public.svg-image", [&](std::string_view t) { seen.emplace_back(t); });
  // public.data and public.content are reached through both public.image and public.xml.
  EXPECT_EQ(seen, (Types{"public.svg-image", "public.image", "public.xml", "public.data",
                         "public.content", "public.text", "public.item"}));
  for (const std::string& ancestor : seen)
    EXPECT_TRUE(types.conforms("public.svg-image", ancestor));
  EXPECT_FALSE(types.conforms("public.image", "public.svg-image"));
  EXPECT_FALSE(types.conforms("public.svg-image", "public.png"));
  EXPECT_TRUE(types.conforms("com.example.unknown", "com.example.unknown"));
  EXPECT_FALSE(types.conforms("com.example.unknown", "public.item"));
}

TEST(TypeSystem, FilesExtendTheHierarchyAndBadOnesOrCyclesAreLeftOut) {
  testing::TempDir dir;
  auto write = [&](const char* name, const Value& value) {
    ASSERT_TRUE(testing::writeFile(dir.file(name), dmap::write(value).value()));
  };
  write("camera.dmap", Dictionary{{"com.example.raw", Array{"public.image"}},
                                  {"public.png", Array{"com.example.lossless"}},
                                  {"com.example.lossless", Array{"public.data"}}});
  // A file with one bad entry is skipped whole.
  write("bad-parent.dmap", Dictionary{{"com.example.b", Array{"public.data", 7}},
                                      {"com.example.c", Array{"public.data"}}});
  write("bad-root.dmap", Array{"x"});
  write("not-dmap.txt", Dictionary{{"com.example.txt", Array{"public.text"}}});
  ASSERT_TRUE(testing::writeFile(dir.file("broken.dmap"), "<dmap version=\"1.0\"><dict>"));
  Array tooMany(65, Value("public.data"));
  write("too-many.dmap", Dictionary{{"com.example.e", tooMany}});
  // Sorted after camera.dmap, where public.png -> lossless made these two edges cycles.
  write("cycles.dmap", Dictionary{{"com.example.lossless", Array{"public.png", "public.item"}},
                                  {"com.example.self", Array{"com.example.self"}}});
  auto types = TypeSystem::loadFrom(dir.path());
  EXPECT_TRUE(types->conforms("com.example.raw", "public.item"));
  EXPECT_EQ(types->parents("public.png"), (Types{"public.image", "com.example.lossless"}));
  EXPECT_EQ(types->parents("com.example.lossless"), (Types{"public.data", "public.item"}));
  for (const char* type :
       {"com.example.b", "com.example.c", "com.example.txt", "com.example.e", "com.example.self"}) {
    EXPECT_TRUE(types->parents(type).empty()) << type;
  }
  EXPECT_TRUE(types->evaluateActivationRule(Dictionary{{"public.image", 1}},
                                            Dictionary{{"com.example.raw", 1}}));
  EXPECT_TRUE(TypeSystem::loadFrom(dir.file("absent"))->conforms("public.png", "public.image"));
}

TEST(TypeSystem, ActivationRuleBoundsTheItemsOfEachType) {
  constexpr uint64_t kMax = std::numeric_limits<uint64_t>::max();
  const struct {
    const char* name;
    Value rule;
    Dictionary items;
    bool accepts;
  } cases[] = {
      {"true takes any number",
       Dictionary{{"public.image", true}},
       {{"public.jpeg", 100000}},
       true},
      {"false is no limit", Dictionary{{"public.image", false}}, {{"public.jpeg", 1}}, false},
      {"within limit", Dictionary{{"public.image", 3}}, {{"public.jpeg", 3}}, true},
      {"conforming types add up",
       Dictionary{{"public.image", 3}},
       {{"public.jpeg", 2}, {"public.png", 2}},
       false},
      {"a type no rule type takes",
       Dictionary{{"public.image", 5}},
       {{"public.jpeg", 1}, {"public.plain-text", 1}},
       false},
      {"unless none of it",
       Dictionary{{"public.image", 5}},
       {{"public.jpeg", 1}, {"public.plain-text", 0}},
       true},
      {"unknown type", Dictionary{{"public.item", true}}, {{"com.example.unknown", 1}}, false},
      {"each rule type counts",
       Dictionary{{"public.image", 1}, {"public.text", 2}},
       {{"public.jpeg", 1}, {"public.html", 1}, {"public.json", 1}},
       true},
      {"under every rule type it conforms to",
       Dictionary{{"public.image", 5}, {"public.data", 1}},
       {{"public.jpeg", 2}},
       false},
      {"zero and no items of it",
       Dictionary{{"public.image", 0}, {"public.text", 1}},
       {{"public.html", 1}},
       true},
      {"negative limit", Dictionary{{"public.image", -1}}, {{"public.jpeg", 1}}, false},
      {"double rounds down", Dictionary{{"public.image", 2.9}}, {{"public.jpeg", 3}}, false},
      {"huge double", Dictionary{{"public.image", 1e30}}, {{"public.jpeg", kMax}}, true},
      {"nan", Dictionary{{"public.image", std::nan("")}}, {{"public.jpeg", 1}}, false},
      {"counts saturate",
       Dictionary{{"public.image", kMax - 1}},
       {{"public.jpeg", kMax}, {"public.png", 2}},
       false},
      {"string limit", Dictionary{{"public.image", "3"}}, {{"public.jpeg", 1}}, false},
      {"negative count", Dictionary{{"public.image", true}}, {{"public.jpeg", -1}}, false},
      {"string count", Dictionary{{"public.image", true}}, {{"public.jpeg", "1"}}, false},
      {"no items", Dictionary{{"public.image", 1}}, {}, true},
      {"empty rule", Dictionary{}, {{"public.jpeg", 1}}, false},
      {"rule not a dictionary", Value(Array{"public.image"}), {{"public.jpeg", 1}}, false},
  };
  TypeSystem types;
  for (const auto& c : cases) {
    EXPECT_EQ(types.evaluateActivationRule(c.rule, c.items), c.accepts) << c.name;
  }
}

}  // namespace
}  // namespace ek::types
