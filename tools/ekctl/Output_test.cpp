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

TEST(EkctlOutput, TablesAndJsonHaveOneShapePerCommand) {
  const Value two(Dictionary{
      {"matches", Array{form("com.example.viewer.thumbs", "1.2", "/A"), form("b", "10", "/B")}}});
  EXPECT_EQ(replyAsTable("match", two),
            "IDENTIFIER                 VERSION  UUID                                  PATH\n"
            "com.example.viewer.thumbs  1.2      E621E1F8-C36C-495A-93FC-0C247A3E6E5F  /A\n"
            "b                          10       E621E1F8-C36C-495A-93FC-0C247A3E6E5F  /B\n"
            "2 plug-ins\n");
  const Value one = onePlugInNamed(two, "b").value();
  EXPECT_EQ(replyAsTable("find", one),
            "identifier  b\npath        /B\nuuid        E621E1F8-C36C-495A-93FC-0C247A3E6E5F\n"
            "version     10\n");
  const std::tuple<const char*, Value, const char*> rows[] = {
      {"list", Value(Dictionary{{"matches", Array{Dictionary{{"b", 1}, {"a", true}}}}}),
       "[\n  {\n    \"a\": true,\n    \"b\": 1\n  }\n]\n"},
      {"find", Value(Dictionary{{"errorcode", 15}, {"error", "Cannot locate PlugIn"}}),
       "{\n  \"error\": {\n    \"code\": 15,\n    \"message\": \"Cannot locate PlugIn\"\n  }\n}\n"},
  };
  for (const auto& [command, reply, json] : rows) {
    EXPECT_EQ(replyAsPlainJson(command, reply), json) << command;
  }
  EXPECT_EQ(urlArgument("/opt/My App.app"), "file:///opt/My%20App.app");
}

}  // namespace
}  // namespace ek::ekctl
