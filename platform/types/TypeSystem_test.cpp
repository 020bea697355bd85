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
  EXPECT_TRUE(types.conforms("public.svg-image", "public.text"));
  EXPECT_FALSE(types.conforms("public.image", "public.svg-image"));
  EXPECT_TRUE(types.conforms("com.example.x", "com.example.x"));  // unknown, and nothing more
  EXPECT_FALSE(types.conforms("com.example.x", "public.item"));
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
  ASSERT_TRUE(testing::writeFile(dir.file("broken.dmap"), "<dmap version=\"1.0\"><dict>"));
  // Read after camera.dmap: lossless -> public.png and self -> self would close cycles.
  write("cycles.dmap", Dictionary{{"com.example.lossless", Array{"public.png", "public.item"}},
                                  {"com.example.self", Array{"com.example.self"}}});
  auto types = TypeSystem::loadFrom(dir.path());
  EXPECT_TRUE(types->conforms("com.example.raw", "public.item"));
  EXPECT_EQ(types->parents("public.png"), (Types{"public.image", "com.example.lossless"}));
  EXPECT_EQ(types->parents("com.example.lossless"), (Types{"public.data", "public.item"}));
  for (const char* type : {"com.example.b", "com.example.c", "com.example.self"}) {
    EXPECT_TRUE(types->parents(type).empty()) << type;
  }
  EXPECT_TRUE(types->evaluateActivationRule(Dictionary{{"public.image", 1}},
                                            Dictionary{{"com.example.raw", 1}}));
}

TEST(TypeSystem, ActivationRuleBoundsTheItemsOfEachType) {
  constexpr uint64_t kMax = std::numeric_limits<uint64_t>::max();
  // Whether the rule accepts the items; a limit counts every item conforming to its type.
  const std::tuple<bool, Value, Dictionary> cases[] = {
      {true, Dictionary{{"public.image", true}}, {{"public.jpeg", 100000}}},
      {false, Dictionary{{"public.image", false}}, {{"public.jpeg", 1}}},
      {false, Dictionary{{"public.image", 4}}, {{"public.jpeg", 2}, {"public.png", 3}}},
      // A host type no rule type takes is refused, unless there are none of it.
      {false, Dictionary{{"public.image", 5}}, {{"public.jpeg", 5}, {"public.html", 1}}},
      {true, Dictionary{{"public.image", 5}}, {{"public.jpeg", 5}, {"com.example.x", 0}}},
      {true,
       Dictionary{{"public.image", 1}, {"public.text", 2}},
       {{"public.jpeg", 1}, {"public.html", 1}, {"public.json", 1}}},
      {false, Dictionary{{"public.image", 5}, {"public.data", 1}}, {{"public.jpeg", 2}}},
      {false, Dictionary{{"public.image", 2.9}}, {{"public.jpeg", 3}}},
      {false, Dictionary{{"public.image", kMax - 1}}, {{"public.jpeg", kMax}, {"public.png", 2}}},
      {false, Dictionary{{"public.image", std::nan("")}}, {{"public.jpeg", 1}}},
      {false, Dictionary{{"public.image", true}}, {{"public.jpeg", "1"}}},
      {false, Value(Array{"public.image"}), {{"public.jpeg", 1}}},
  };
  TypeSystem types;
  for (const auto& [accepts, rule, items] : cases) {
    EXPECT_EQ(types.evaluateActivationRule(rule, items), accepts)
        << rule.description() << " " << Value(items).description();
  }
}

}  // namespace
}  // namespace ek::types
