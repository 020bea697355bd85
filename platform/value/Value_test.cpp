#include "platform/value/Value.h"

#include <gtest/gtest.h>

namespace ek {
namespace {

TEST(Uuid, ParsesEitherCaseWritesUpperCaseAndRefusesAnythingElse) {
  const std::string upper = "E621E1F8-C36C-495A-93FC-0C247A3E6E5F";
  EXPECT_EQ(Uuid::parse("e621e1f8-c36c-495a-93fc-0c247a3e6e5f")->string(), upper);
  for (const char* text :
       {"", "E621E1F8C36C495A93FC0C247A3E6E5F", "E621E1F8-C36C-495A-93FC-0C247A3E6E5FF",
        "G621E1F8-C36C-495A-93FC-0C247A3E6E5F"}) {
    EXPECT_FALSE(Uuid::parse(text)) << text;
  }
  EXPECT_EQ(Uuid::random().bytes[6] >> 4, 4);  // version 4
}

}  // namespace
}  // namespace ek
