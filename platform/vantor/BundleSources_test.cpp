#include "platform/vantor/BundleSources.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "platform/cbor/Cbor.h"
#include "platform/value/Value.h"

namespace ek::vantor {
namespace {

namespace fs = std::filesystem;

class BundleSourcesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/bundle-sources-XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    dir_ = pattern;
    write("Info.dmap", "<dmap/>");
    write("shared.dmap", "shared");
  }
  void TearDown() override { fs::remove_all(dir_); }

  std::string path(const std::string& name) const { return dir_ + "/" + name; }
  void write(const std::string& name, const std::string& text) {
    std::ofstream(path(name), std::ios::binary | std::ios::trunc) << text;
  }

  // A record of Info.dmap, an absent file and a shared file, with nothing settling.
  std::vector<uint8_t> record(const std::string& context = "ctx") {
    BundleSources sources(context, 0);
    sources.note(path("Info.dmap"));
    sources.note(path("absent.entitlements"));
    sources.noteShared(path("shared.dmap"));
    auto bytes = sources.record();
    EXPECT_TRUE(bytes.has_value());
    return bytes.value_or(std::vector<uint8_t>{});
  }
  bool unchanged(const std::vector<uint8_t>& bytes, const std::string& context = "ctx") {
    return BundleSources::Checker(context).unchanged(bytes);
  }

  std::string dir_;
};

TEST_F(BundleSourcesTest, RecordHoldsUntilOneOfItsFilesChanges) {
  auto bytes = record();
  EXPECT_TRUE(unchanged(bytes));
  EXPECT_FALSE(unchanged(bytes, "another state directory"));

  struct Change {
    const char* what;
    std::function<void()> make;
  };
  const Change changes[] = {
      {"rewritten in place", [&] { write("Info.dmap", "<dmap>longer</dmap>"); }},
      {"replaced by a rename",
       [&] {
         write("new", "<dmap/>");
         fs::rename(path("new"), path("Info.dmap"));
       }},
      {"removed", [&] { fs::remove(path("Info.dmap")); }},
      {"absent file created", [&] { write("absent.entitlements", "<dmap/>"); }},
      {"shared file changed", [&] { write("shared.dmap", "changed"); }},
  };
  for (const Change& change : changes) {
    write("Info.dmap", "<dmap/>");
    fs::remove(path("absent.entitlements"));
    write("shared.dmap", "shared");
    auto fresh = record();
    ASSERT_TRUE(unchanged(fresh)) << change.what;
    change.make();
    EXPECT_FALSE(unchanged(fresh)) << change.what;
  }
}

// With its directory recorded first, an absent file's creation shows in the directory's stamp.
TEST_F(BundleSourcesTest, AbsentFileOfARecordedDirectoryIsSeenOnceCreated) {
  // The directory's time is set back, so that a creation changes it even within the clock's
  // granularity (files settled long ago, as the scan requires).
  auto recordOfDirectory = [&] {
    const struct timespec old[2] = {{time(nullptr) - 3600, 0}, {time(nullptr) - 3600, 0}};
    EXPECT_EQ(utimensat(AT_FDCWD, dir_.c_str(), old, 0), 0);
    BundleSources sources("ctx", 0);
    sources.note(dir_);
    sources.note(path("absent.entitlements"));
    sources.note(path("absent.lproj/table.strings"));
    return sources.record().value_or(std::vector<uint8_t>{});
  };
  auto bytes = recordOfDirectory();
  ASSERT_TRUE(unchanged(bytes));
  write("absent.entitlements", "<dmap/>");
  EXPECT_FALSE(unchanged(bytes));

  fs::remove(path("absent.entitlements"));
  bytes = recordOfDirectory();
  ASSERT_TRUE(unchanged(bytes));
  fs::create_directory(path("absent.lproj"));
  EXPECT_FALSE(unchanged(bytes));
}

TEST_F(BundleSourcesTest, NoRecordWhenAFileIsTooFreshOrNotAFileAtAll) {
  BundleSources fresh("ctx", 3600);
  fresh.note(path("Info.dmap"));
  EXPECT_FALSE(fresh.record());

  BundleSources external("ctx", 0);
  external.note(path("Info.dmap"));
  external.markUncheckable();
  EXPECT_FALSE(external.record());

  // Only absent files: nothing is too fresh.
  BundleSources none("ctx", 3600);
  none.note(path("missing"));
  EXPECT_TRUE(none.record());
}

TEST_F(BundleSourcesTest, MalformedRecordsNeverMatch) {
  auto good = record();
  std::vector<std::vector<uint8_t>> bad = {
      {},
      {0xff, 0x00, 0x13},
      std::vector<uint8_t>(good.begin(), good.begin() + static_cast<long>(good.size() / 2)),
      cbor::encode(Value("ctx")),
      cbor::encode(Value(Array{Value("ctx")})),
      cbor::encode(
          Value(Array{Value("ctx"), Value(Array{Value(Array{Value(path("Info.dmap"))})})})),
      cbor::encode(Value(Array{Value("ctx"), Value(Array{Value(Array{Value(1u), Value(false)})})})),
      cbor::encode(
          Value(Array{Value("ctx"), Value(Array{Value(Array{Value(path("Info.dmap")), Value(false),
                                                            Value(1u), Value(2u), Value(3u)})})})),
  };
  for (size_t i = 0; i < bad.size(); ++i) EXPECT_FALSE(unchanged(bad[i])) << i;
  // A stamp of the right shape but wrong numbers, for a file that exists.
  Array entry{Value(path("Info.dmap")), Value(false)};
  for (int i = 0; i < 7; ++i) entry.emplace_back(uint64_t{7});
  EXPECT_FALSE(unchanged(cbor::encode(Value(Array{Value("ctx"), Value(Array{Value(entry)})}))));
  EXPECT_TRUE(unchanged(good));
}

}  // namespace
}  // namespace ek::vantor
