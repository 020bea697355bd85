// What a hostile client, a full disk or a killed daemon can do to the annotations of everyone
// else: values the file cannot hold are refused, an acknowledged change is on disk, and what a
// killed daemon leaves behind is cleaned up or reported.
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <fstream>
#include <limits>

#include "platform/dmap/Dmap.h"
#include "platform/value/Uuid.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;

constexpr const char* kThumbsId = "com.corvane.example.viewer.thumbs";
constexpr const char* kShareId = "com.corvane.example.viewer.share";

Value annotate(Dictionary annotations, const Uuid& uuid) {
  return request("annotate", {{"annotations", Value(std::move(annotations))},
                              {"uuids", Value(Array{Value(uuid)})}});
}

// A daemon with Viewer.app registered.
class Viewer {
 public:
  explicit Viewer(std::vector<std::string> args = {}) : daemon(std::move(args)) {
    root = fs::canonical(daemon.root().path());
    fs::copy(fs::path(EXAMPLES_DIR) / "Applications/Viewer.app", root / "Viewer.app",
             fs::copy_options::recursive);
  }

  // Starts the daemon, registers Viewer.app and finds its two plug-ins.
  bool start() {
    if (!daemon.start()) return false;
    std::string app = (root / "Viewer.app").string();
    Value added = ask(request("add", {{"paths", Value(Array{Value(app)})}}));
    if (replyErrorCode(added) != 0) return false;
    thumbs = uuidOf(app + "/PlugIns/Thumbs.appex");
    share = uuidOf(app + "/PlugIns/Share.appex");
    return !thumbs.isNull() && !share.isNull();
  }

  Value ask(const Value& message) {
    auto reply = daemon.ask(message);
    EXPECT_TRUE(reply.has_value()) << "no reply to " << message.description().substr(0, 200) << "\n"
                                   << daemon.log();
    return reply ? *reply : Value(Dictionary{{"errorcode", Value(uint64_t{999})}});
  }

  Uuid uuidOf(const std::string& path) {
    Value reply = ask(request("find", {{"paths", Value("file://" + path)}}));
    const Value* form = reply.get("matches");
    const std::string* uuid = form ? form->getString("uuid") : nullptr;
    return uuid && Uuid::parse(*uuid) ? *Uuid::parse(*uuid) : Uuid();
  }

  // The "annotations" of the plug-in's form as "find" answers it.
  Value found(const Uuid& uuid) {
    Value reply = ask(request("find", {{"uuids", Value(uuid)}}));
    const Value* form = reply.get("matches");
    const Value* annotations = form ? form->get("annotations") : nullptr;
    return annotations ? *annotations : Value("<absent>");
  }

  EkdProcess daemon;
  fs::path root;
  Uuid thumbs, share;
};

Value nested(int levels) {
  Value value(Dictionary{});
  for (int i = 1; i < levels; ++i) value = Value(Dictionary{{"d", std::move(value)}});
  return value;
}

TEST(HostileAnnotation, ValuesTheFileCannotHoldAreRefusedAndLoseNobodysChanges) {
  Viewer viewer;
  ASSERT_TRUE(viewer.start()) << viewer.daemon.log();
  const double nan = std::numeric_limits<double>::quiet_NaN();
  const double infinity = std::numeric_limits<double>::infinity();
  auto extension = [](Value value) {
    return Dictionary{{"extension", Value(Dictionary{{"v", std::move(value)}})}};
  };
  struct Case {
    const char* what;
    Dictionary annotations;
    int64_t code;
  };
  const std::vector<Case> cases = {
      {"NaN election", {{"election", Value(nan)}}, 4},
      {"infinite election", {{"election", Value(-infinity)}}, 4},
      {"infinite real", extension(Value(infinity)), 4},
      {"control character", extension(Value("bell\x07")), 4},
      {"NUL", extension(Value(std::string("a\0b", 3))), 4},
      {"U+FFFE", extension(Value("\xef\xbf\xbe")), 4},
      {"control character in a key", {{"extension", Value(Dictionary{{"k\x1f", Value(1)}})}}, 4},
      {"non-finite date", extension(Value(Date{nan})), 4},
      {"date before the year 0001", extension(Value(Date{-62135596801})), 4},
      {"date after the year 9999", extension(Value(Date{253402300800})), 4},
      {"nesting of 510 levels", {{"extension", nested(510)}}, 4},
      {"over 64 KiB", extension(Value(std::string(65 * 1024, 'x'))), 18},
      {"30 MB", extension(Value(std::string(30 << 20, 'x'))), 18},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    Value reply = viewer.ask(annotate(c.annotations, viewer.thumbs));
    EXPECT_EQ(replyErrorCode(reply), c.code) << reply.description().substr(0, 300);
    EXPECT_FALSE(replyError(reply).empty());
    // The same values per plug-in of a bulk change.
    if (const Value* value =
            c.annotations.count("extension") ? &c.annotations.at("extension") : nullptr) {
      Value bulk = viewer.ask(request(
          "bulk-annotate", {{"annotations", Value(Dictionary{{viewer.thumbs.string(), *value}})}}));
      EXPECT_EQ(replyErrorCode(bulk), 18) << bulk.description().substr(0, 300);
    }
  }
  EXPECT_EQ(viewer.found(viewer.thumbs), Value(Dictionary{}));

  // Other clients' changes are kept, on disk: an election given as a boolean is the number.
  Value elected = viewer.ask(annotate({{"election", Value(true)}}, viewer.thumbs));
  EXPECT_EQ(replyErrorCode(elected), 0) << elected.description();
  const Dictionary kept{{"ok", Value(1)}};
  Value extended = viewer.ask(annotate({{"extension", Value(kept)}}, viewer.share));
  EXPECT_EQ(replyErrorCode(extended), 0) << extended.description();
  viewer.daemon.kill9();
  ASSERT_TRUE(viewer.daemon.start()) << viewer.daemon.log();
  EXPECT_EQ(viewer.found(viewer.thumbs), Value(Dictionary{{"election", Value(1)}}));
  EXPECT_EQ(viewer.found(viewer.share), Value(Dictionary{{"extension", Value(kept)}}));
  Result<Value> file = dmap::readFile(viewer.daemon.annotationFile());
  ASSERT_TRUE(file.ok()) << file.error().message;
  const Dictionary* data = file->getDictionary("data");
  ASSERT_NE(data, nullptr);
  EXPECT_EQ(data->size(), 2u);
  EXPECT_TRUE(data->contains(kThumbsId) && data->contains(kShareId));
}

// A small file system of its own for the annotation file, filled up on demand.
class SmallFileSystem {
 public:
  explicit SmallFileSystem(const fs::path& where) : path_(where) {
    fs::create_directories(path_);
    mounted_ = ::mount("tmpfs", path_.c_str(), "tmpfs", 0, "size=1m") == 0;
  }
  ~SmallFileSystem() {
    if (mounted_) ::umount2(path_.c_str(), MNT_DETACH);
  }
  bool mounted() const { return mounted_; }
  void fill() {
    std::ofstream filler(path_ / "filler", std::ios::binary);
    const std::string chunk(4096, '\0');
    while (filler.write(chunk.data(), static_cast<std::streamsize>(chunk.size()))) {
      filler.flush();
    }
  }
  void free() { fs::remove(path_ / "filler"); }

 private:
  fs::path path_;
  bool mounted_ = false;
};

TEST(HostileAnnotation, FullDiskIsAnErrorReplyAndLosesNothingAcknowledged) {
  if (::geteuid() != 0) GTEST_SKIP() << "mounting a small file system needs root";
  TempDir scratch;
  const fs::path small = fs::canonical(scratch.path()) / "small";
  SmallFileSystem disk(small);
  if (!disk.mounted()) GTEST_SKIP() << "cannot mount a tmpfs here: " << std::strerror(errno);
  {
    Viewer viewer({"-d", (small / "Ekora-Annotations").string()});
    ASSERT_TRUE(viewer.start()) << viewer.daemon.log();
    auto numbered = [](uint64_t n) {
      return Dictionary{{"extension", Value(Dictionary{{"n", Value(n)}})}};
    };
    ASSERT_EQ(replyErrorCode(viewer.ask(annotate(numbered(1), viewer.thumbs))), 0);

    disk.fill();
    Value refused = viewer.ask(annotate(numbered(2), viewer.thumbs));
    EXPECT_EQ(replyErrorCode(refused), ENOSPC) << refused.description();
    Value bulk = viewer.ask(request(
        "bulk-annotate",
        {{"annotations",
          Value(Dictionary{{viewer.share.string(), Value(Dictionary{{"n", Value(3)}})},
                           {viewer.thumbs.string(), Value(Dictionary{{"n", Value(3)}})}})}}));
    EXPECT_EQ(replyErrorCode(bulk), ENOSPC) << bulk.description();
    // Nothing of the refused changes is kept, in memory or after a kill.
    EXPECT_EQ(viewer.found(viewer.thumbs), Value(numbered(1)));
    EXPECT_EQ(viewer.found(viewer.share), Value(Dictionary{}));
    viewer.daemon.kill9();
    ASSERT_TRUE(viewer.daemon.start()) << viewer.daemon.log();
    EXPECT_EQ(viewer.found(viewer.thumbs), Value(numbered(1)));
    EXPECT_EQ(viewer.found(viewer.share), Value(Dictionary{}));

    disk.free();
    ASSERT_EQ(replyErrorCode(viewer.ask(annotate(numbered(4), viewer.thumbs))), 0);
    viewer.daemon.kill9();
    ASSERT_TRUE(viewer.daemon.start()) << viewer.daemon.log();
    EXPECT_EQ(viewer.found(viewer.thumbs), Value(numbered(4)));
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(small)) {
      names.push_back(entry.path().filename().string());
    }
    EXPECT_EQ(names, std::vector<std::string>{"Ekora-Annotations"});
    viewer.daemon.kill9();
  }
}

TEST(HostileAnnotation, TemporariesOfAKilledDaemonAreRemovedAtStart) {
  Viewer viewer;
  const fs::path state = viewer.root / "state";
  const Dictionary table{{kThumbsId, Value(Dictionary{{"election", Value(1)}})}};
  ASSERT_TRUE(
      dmap::writeFileAtomically((state / "Ekora-Annotations").string(),
                                Value(Dictionary{{"version", Value(16)}, {"data", Value(table)}}))
          .ok());
  for (const char* name : {".Ekora-Annotations.Ab12Cd", ".Ekora-Annotations.zz9YY8",
                           "Ekora-Annotations.bad-20260101T000000Z"}) {
    std::ofstream(state / name) << "left behind";
  }
  ASSERT_TRUE(viewer.start()) << viewer.daemon.log();
  EXPECT_EQ(viewer.found(viewer.thumbs), Value(Dictionary{{"election", Value(1)}}));
  EXPECT_FALSE(fs::exists(state / ".Ekora-Annotations.Ab12Cd"));
  EXPECT_FALSE(fs::exists(state / ".Ekora-Annotations.zz9YY8"));
  EXPECT_TRUE(fs::exists(state / "Ekora-Annotations.bad-20260101T000000Z"));
}

TEST(HostileAnnotation, DamagedRegistryLogIsReportedAndKeptAside) {
  Viewer viewer;
  ASSERT_TRUE(viewer.start()) << viewer.daemon.log();
  // Killed before the registry went idle: its changes are still in the log.
  viewer.daemon.kill9();
  const fs::path state = viewer.root / "state";
  const fs::path wal = state / "registry.db-wal";
  ASSERT_GT(fs::file_size(wal), 32u);
  {
    std::fstream file(wal, std::ios::in | std::ios::out | std::ios::binary);
    const std::string noise(32, 'x');
    file.write(noise.data(), static_cast<std::streamsize>(noise.size()));
  }
  ASSERT_TRUE(viewer.daemon.start()) << viewer.daemon.log();
  EXPECT_TRUE(viewer.daemon.logShows("registry write-ahead log " + wal.string() + " is unusable"))
      << viewer.daemon.log();
  bool keptAside = false;
  for (const auto& entry : fs::directory_iterator(state)) {
    const std::string name = entry.path().filename().string();
    keptAside |= name.starts_with("registry.db.corrupt-") && name.ends_with("-wal");
  }
  EXPECT_TRUE(keptAside);
}

}  // namespace
}  // namespace ek::test
