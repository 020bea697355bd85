#include "tools/ekctl/Output.h"

#include <gtest/gtest.h>

namespace ek::ekctl {
namespace {

Value form(const char* identifier, const char* version, const char* path) {
  return Value(Dictionary{{"identifier", identifier},
                          {"version", version},
                          {"uuid", *Uuid::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F")},
                          {"path", path}});
}

TEST(EkctlOutput, MatchRepliesBecomeATableOfPlugIns) {
  Value reply(Dictionary{{"matches", Array{form("com.example.viewer.thumbs", "1.2", "/A/T.appex"),
                                           form("com.example.share", "10", "/B/S.appex")}}});
  EXPECT_EQ(replyAsTable("match", reply),
            "IDENTIFIER                 VERSION  UUID                                  PATH\n"
            "com.example.viewer.thumbs  1.2      E621E1F8-C36C-495A-93FC-0C247A3E6E5F  /A/T.appex\n"
            "com.example.share          10       E621E1F8-C36C-495A-93FC-0C247A3E6E5F  /B/S.appex\n"
            "2 plug-ins\n");
}

TEST(EkctlOutput, FindShowsTheFormsFieldsAndOtherRepliesTheirKeys) {
  Value found(Dictionary{{"matches", form("com.example.share", "10", "/B/S.appex")}});
  EXPECT_EQ(replyAsTable("find", found),
            "identifier  com.example.share\n"
            "path        /B/S.appex\n"
            "uuid        E621E1F8-C36C-495A-93FC-0C247A3E6E5F\n"
            "version     10\n");
  EXPECT_EQ(replyAsTable("add", Value(Dictionary{})), "ok\n");
  EXPECT_EQ(replyAsTable("hold", Value(Dictionary{{"uuids", Array{1, 2}}})), "uuids  [1,2]\n");
}

TEST(EkctlOutput, JsonIsPrettyWithSortedKeys) {
  EXPECT_EQ(replyAsJson(Value(Dictionary{{"b", 1}, {"a", true}})),
            "{\n  \"a\": true,\n  \"b\": 1\n}\n");
}

TEST(EkctlOutput, PlainJsonHasOneShapePerCommand) {
  Value form(Dictionary{{"uuid", *Uuid::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F")}});
  const struct {
    const char* command;
    Value reply;
    const char* json;
  } cases[] = {
      {"list", Value(Dictionary{{"matches", Array{form}}}),
       "[\n  {\n    \"uuid\": \"E621E1F8-C36C-495A-93FC-0C247A3E6E5F\"\n  }\n]\n"},
      {"find", Value(Dictionary{{"matches", form}}),
       "{\n  \"uuid\": \"E621E1F8-C36C-495A-93FC-0C247A3E6E5F\"\n}\n"},
      {"add", Value(Dictionary{}), "{\n  \"ok\": true\n}\n"},
      {"find", Value(Dictionary{{"errorcode", 15}, {"error", "Cannot locate PlugIn"}}),
       "{\n  \"error\": {\n    \"code\": 15,\n    \"message\": \"Cannot locate PlugIn\"\n  }\n}\n"},
      {"hold", Value(Dictionary{{"uuids", Array{Date{0}}}}),
       "{\n  \"uuids\": [\n    \"1970-01-01T00:00:00Z\"\n  ]\n}\n"},
  };
  for (const auto& c : cases) EXPECT_EQ(replyAsPlainJson(c.command, c.reply), c.json) << c.command;
}

TEST(EkctlOutput, InfoByIdentifierPicksThatPlugIn) {
  Value reply(Dictionary{{"matches", Array{form("a", "1", "/A"), form("b", "2", "/B")}}});
  auto found = onePlugInNamed(reply, "b");
  ASSERT_TRUE(found.ok());
  EXPECT_EQ(*found->get("matches")->getString("path"), "/B");
  EXPECT_FALSE(onePlugInNamed(reply, "c").ok());
}

TEST(EkctlOutput, PathsBecomeFileUrlsAndUrlsStayAsGiven) {
  EXPECT_EQ(urlArgument("/opt/My App.app"), "file:///opt/My%20App.app");
  EXPECT_EQ(urlArgument("file:///x"), "file:///x");
}

}  // namespace
}  // namespace ek::ekctl
