// The daemon reads each client's entitlements and refuses files anyone else could have written.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>

#include "tests/EkdProcess.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;

// The manager entitlement with the given dmap value.
std::string entitlements(const std::string& value) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<dmap version=\"1.0\">\n<dict>\n"
         "\t<key>com.corvane.private.ekora.manager</key>\n\t" +
         value + "\n</dict>\n</dmap>\n";
}

class Entitlements : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(daemon_.start()) << daemon_.log(); }
  void TearDown() override { EXPECT_EQ(daemon_.terminate(), 0); }

  // A copy of ekctl with an entitlements file of the given mode and owner beside it.
  std::string ekctlCopy(const std::string& name, mode_t mode, uid_t owner,
                        const std::string& value = "<true/>") {
    fs::path dir = daemon_.root().path() / name;
    fs::create_directories(dir);
    fs::path program = dir / "ekctl";
    fs::copy_file(ekctlPath(), program);
    std::ofstream(program.string() + ".entitlements") << entitlements(value);
    std::string entitlements = program.string() + ".entitlements";
    EXPECT_EQ(chmod(entitlements.c_str(), mode), 0);
    EXPECT_EQ(chown(entitlements.c_str(), owner, static_cast<gid_t>(-1)), 0);
    return program.string();
  }

  bool refusalLogged(const std::string& program) {
    return daemon_.log().find("ignoring entitlements of " + program) != std::string::npos;
  }

  void ask(const std::string& program) {
    auto result = runCommand({program, "-S", daemon_.service(), "raw", R"({"request": "x"})"},
                             daemon_.environment());
    ASSERT_EQ(result.status, 0) << result.err;
  }

  EkdProcess daemon_;
};

TEST_F(Entitlements, FileOwnedAndWritableOnlyByTheOwnerIsHonoured) {
  std::string program = ekctlCopy("trusted", 0644, geteuid());
  ask(program);
  EXPECT_FALSE(refusalLogged(program)) << daemon_.log();
}

// Held when present and not false, whatever else the value is: privileged discovery shows it.
TEST_F(Entitlements, AnEntitlementIsHeldUnlessItIsFalse) {
  const struct {
    const char* name;
    const char* value;
    int status;
  } cases[] = {{"true", "<true/>", 0},
               {"zero", "<integer>0</integer>", 0},
               {"text", "<string>no</string>", 0},
               {"false", "<false/>", 1}};
  for (const auto& c : cases) {
    std::string program = ekctlCopy(c.name, 0644, geteuid(), c.value);
    auto result = runCommand({program, "-S", daemon_.service(), "match", "--flags", "512"},
                             daemon_.environment());
    EXPECT_EQ(result.status, c.status) << c.name << ": " << result.err;
  }
}

TEST_F(Entitlements, FileWritableByOthersGrantsNothing) {
  std::string program = ekctlCopy("writable", 0666, geteuid());
  ask(program);
  EXPECT_TRUE(refusalLogged(program)) << daemon_.log();
}

TEST_F(Entitlements, FileOwnedByAnotherUserGrantsNothing) {
  if (geteuid() != 0) GTEST_SKIP() << "only root can give a file to another user";
  std::string program = ekctlCopy("foreign", 0644, 65534);
  ask(program);
  EXPECT_TRUE(refusalLogged(program)) << daemon_.log();
}

}  // namespace
}  // namespace ek::test
