#include "platform/privo/Consent.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include "platform/dmap/Dmap.h"
#include "platform/log/testing/CapturingSink.h"
#include "platform/testing/Files.h"

namespace ek::privo {
namespace {

using Services = std::vector<std::string>;

// The file goes through states in turn; each row says what the application is granted then.
TEST(FileConsent, OnlyBooleanTrueGrantsAndAnUnusableFileIsLoggedOncePerVersion) {
  testing::TempDir dir;
  auto sink = std::make_shared<log::testing::CapturingSink>();
  log::setSink(sink);
  setenv("EKORA_STATE_DIR", dir.path().c_str(), 1);
  FileConsent consent;
  const std::string file = dir.file("consent.dmap");
  auto granting = [](const Dictionary& app) {
    return dmap::write(Value(Dictionary{{"com.example.app", Value(app)}})).value();
  };
  // Name; the file's new bytes (absent: left as it is); the services granted (absent: nothing
  // is known); errors logged so far.
  using Step = std::tuple<const char*, std::optional<std::string>, std::optional<Services>, int>;
  const Step steps[] = {
      {"missing", std::nullopt, Services{}, 0},
      {"granted",
       granting({{"b", true}, {"a", true}, {"no", false}, {"text", "true"}, {"number", 1}}),
       Services{"a", "b"}, 0},
      {"malformed", "<dmap version=\"1.0\"><dict><key>x</key></dmap>", std::nullopt, 1},
      {"malformed, read again", std::nullopt, std::nullopt, 1},
      {"replaced", granting({{"c", true}}), Services{"c"}, 1},
      {"not a dictionary", dmap::write(Value(Array{})).value(), std::nullopt, 2},
      {"oversized", granting({}) + std::string(kMaxConsentFileSize, ' '), std::nullopt, 3},
      {"entry not a dictionary", dmap::write(Value(Dictionary{{"com.example.app", true}})).value(),
       Services{}, 3},
  };
  for (const auto& [name, bytes, granted, errors] : steps) {
    SCOPED_TRACE(name);
    ASSERT_TRUE(!bytes || dmap::writeBytesAtomically(file, *bytes).ok());
    EXPECT_EQ(consent.informationForApplication("com.example.app"), granted);
    EXPECT_EQ(consent.grantedServices("com.example.app"), granted.value_or(Services{}));
    EXPECT_EQ(sink->countIf([](const auto& line) { return line.level == log::Level::Error; }),
              errors);
  }
  log::setSink(nullptr);
  unsetenv("EKORA_STATE_DIR");
}

}  // namespace
}  // namespace ek::privo
