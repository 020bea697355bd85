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

TEST(EkctlOutput, PathsBecomeFileUrlsAndUrlsStayAsGiven) {
  EXPECT_EQ(urlArgument("/opt/My App.app"), "file:///opt/My%20App.app");
  EXPECT_EQ(urlArgument("file:///x"), "file:///x");
}

}  // namespace
}  // namespace ek::ekctl
