// bench_fixture: builds and reads the large installation that the daemon benchmarks run on.
//
//   bench_fixture plugins --system-root DIR [--count N] [--points P]
//       N system plug-in bundles DIR/Library/PlugIns/P<i>.bundle (identifier
//       com.corvane.bench.p<i>) spread over P extension points com.corvane.bench.point<j>, each
//       with its SDK file under DIR/Library/ExtensionPoints. Point 0 takes a tenth of them
//       (500 of 10,000), the others share the rest evenly.
//   bench_fixture annotations --file PATH [--count N]
//       an annotation file holding an election and an "extension" dictionary for each of the
//       first N of those plug-ins.
//   bench_fixture requests --registry DB --kind find|annotate [--limit N]
//       one wire-JSON request per line, one per plug-in recorded in the registry database (the
//       daemon must not be running: it holds the file exclusively).

#include <fcntl.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "platform/dmap/Dmap.h"
#include "platform/value/Value.h"

namespace {

using ek::Array;
using ek::Dictionary;
using ek::Value;

constexpr int kSuccess = 0;
constexpr int kFailed = 1;
constexpr int kUsage = 2;
constexpr unsigned kMaxCount = 1000000;
constexpr unsigned kMaxPoints = 10000;
constexpr const char* kPointPrefix = "com.corvane.bench.point";
constexpr const char* kIdentifierPrefix = "com.corvane.bench.p";

bool fail(const std::string& what) {
  std::fprintf(stderr, "bench_fixture: %s\n", what.c_str());
  return false;
}

bool makeDirectories(const std::string& path) {
  for (size_t slash = 1; slash != std::string::npos; slash = path.find('/', slash + 1)) {
    std::string prefix = path.substr(0, slash);
    if (::mkdir(prefix.c_str(), 0755) != 0 && errno != EEXIST) {
      return fail(prefix + ": " + std::strerror(errno));
    }
  }
  if (::mkdir(path.c_str(), 0755) != 0 && errno != EEXIST) {
    return fail(path + ": " + std::strerror(errno));
  }
  return true;
}

// Plain buffered writes: durability does not matter for a fixture, speed does.
bool writeFile(const std::string& path, std::string_view bytes, mode_t mode = 0644) {
  FILE* file = std::fopen(path.c_str(), "wb");
  if (file == nullptr) return fail(path + ": " + std::strerror(errno));
  bool written = std::fwrite(bytes.data(), 1, bytes.size(), file) == bytes.size();
  if (std::fclose(file) != 0) written = false;
  if (!written) return fail(path + ": write failed");
  if (::chmod(path.c_str(), mode) != 0) return fail(path + ": " + std::strerror(errno));
  return true;
}

bool writeDmap(const std::string& path, Value value) {
  ek::Result<std::string> text = ek::dmap::write(value);
  if (!text) return fail(path + ": " + text.error().message);
  return writeFile(path, *text);
}

// Point 0 holds count/10 plug-ins (the discovery benchmark's point); the rest go round-robin
// over the other points.
unsigned pointOf(unsigned index, unsigned count, unsigned points) {
  if (points <= 1) return 0;
  unsigned onPointZero = count / 10;
  if (index < onPointZero) return 0;
  return 1 + (index - onPointZero) % (points - 1);
}

bool writePlugIns(const std::string& systemRoot, unsigned count, unsigned points) {
  const std::string pointsDir = systemRoot + "/Library/ExtensionPoints";
  const std::string plugInsDir = systemRoot + "/Library/PlugIns";
  if (!makeDirectories(pointsDir) || !makeDirectories(plugInsDir)) return false;
  for (unsigned j = 0; j < points; ++j) {
    Dictionary sdk{{"ZuExtension", Value(Dictionary{{"ZuExtensionAttributes",
                                                     Value(Dictionary{{"BenchDefault", 1}})}})}};
    if (!writeDmap(pointsDir + "/" + kPointPrefix + std::to_string(j) + ".dmap", Value(sdk))) {
      return false;
    }
  }
  for (unsigned i = 0; i < count; ++i) {
    const std::string name = "P" + std::to_string(i);
    const std::string bundle = plugInsDir + "/" + name + ".bundle";
    if (::mkdir(bundle.c_str(), 0755) != 0 && errno != EEXIST) {
      return fail(bundle + ": " + std::strerror(errno));
    }
    const std::string point = kPointPrefix + std::to_string(pointOf(i, count, points));
    Dictionary info{
        {"QvBundleIdentifier", Value(kIdentifierPrefix + std::to_string(i))},
        {"QvBundleName", Value(name)},
        {"QvBundleDisplayName", Value("Bench plug-in " + std::to_string(i))},
        {"QvBundleExecutable", Value(name)},
        {"QvBundlePackageType", Value("XPC!")},
        {"QvBundleShortVersionString", Value("1.0")},
        {"QvBundleVersion", Value("1.0")},
        {"ZuExtension",
         Value(Dictionary{
             {"PrincipalClass", Value("BenchPlugIn")},
             {"ZuExtensionPointIdentifier", Value(point)},
             {"ZuExtensionProtocol", Value("BenchService")},
             {"ZuExtensionAttributes",
              Value(Dictionary{
                  {"ZuExtensionVersion", Value("1.0")},
                  {"BenchTypes", Value(Array{Value("public.image"), Value("public.text")})}})}})}};
    if (!writeDmap(bundle + "/Info.dmap", Value(std::move(info)))) return false;
    if (!writeFile(bundle + "/" + name, "#!/bin/sh\nexit 0\n", 0755)) return false;
  }
  return true;
}

bool writeAnnotations(const std::string& path, unsigned count) {
  Dictionary data;
  for (unsigned i = 0; i < count; ++i) {
    data.emplace(kIdentifierPrefix + std::to_string(i),
                 Value(Dictionary{{"election", 1}, {"extension", Value(Dictionary{{"n", 0}})}}));
  }
  return writeDmap(path, Value(Dictionary{{"version", 16}, {"data", Value(std::move(data))}}));
}

std::string uuidText(const unsigned char* bytes) {
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string text;
  for (int i = 0; i < 16; ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) text += '-';
    text += kHex[bytes[i] >> 4];
    text += kHex[bytes[i] & 15];
  }
  return text;
}

bool printRequests(const std::string& database, const std::string& kind, unsigned limit) {
  // Read-write so that SQLite can fold in a write-ahead log the daemon left behind; nothing
  // is written.
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(database.c_str(), &db, SQLITE_OPEN_READWRITE, nullptr) != SQLITE_OK) {
    std::string message = db ? sqlite3_errmsg(db) : "out of memory";
    sqlite3_close(db);
    return fail(database + ": " + message);
  }
  sqlite3_stmt* statement = nullptr;
  const char* query = "SELECT uuid FROM plugins ORDER BY path LIMIT ?1";
  if (sqlite3_prepare_v2(db, query, -1, &statement, nullptr) != SQLITE_OK) {
    std::string message = sqlite3_errmsg(db);
    sqlite3_close(db);
    return fail(database + ": " + message);
  }
  sqlite3_bind_int64(statement, 1, limit);
  int rc;
  unsigned printed = 0;
  while ((rc = sqlite3_step(statement)) == SQLITE_ROW) {
    if (sqlite3_column_bytes(statement, 0) != 16) continue;
    const auto* bytes = static_cast<const unsigned char*>(sqlite3_column_blob(statement, 0));
    std::string uuid = uuidText(bytes);
    if (kind == "find") {
      std::printf(R"({"request":"find","version":3,"uuids":{"$uuid":"%s"}})"
                  "\n",
                  uuid.c_str());
    } else if (kind == "annotate") {
      std::printf(
          R"({"request":"annotate","version":3,"annotations":{"extension":{"n":1}},"uuids":[{"$uuid":"%s"}]})"
          "\n",
          uuid.c_str());
    } else {
      std::printf("%s\n", uuid.c_str());
    }
    ++printed;
  }
  bool ok = rc == SQLITE_DONE;
  if (!ok) fail(database + ": " + sqlite3_errmsg(db));
  sqlite3_finalize(statement);
  sqlite3_close(db);
  if (ok && printed == 0) return fail(database + ": no plug-ins recorded");
  return ok && std::fflush(stdout) == 0;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"bench_fixture: the daemon benchmarks' installation"};
  app.require_subcommand(1);

  std::string systemRoot;
  unsigned count = 10000;
  unsigned points = 20;
  auto* plugIns = app.add_subcommand("plugins", "write system plug-in bundles");
  plugIns->add_option("--system-root", systemRoot, "the system root")->required();
  plugIns->add_option("--count", count, "plug-ins (default 10000)")
      ->check(CLI::Range(1u, kMaxCount));
  plugIns->add_option("--points", points, "extension points (default 20)")
      ->check(CLI::Range(1u, kMaxPoints));

  std::string file;
  auto* annotations = app.add_subcommand("annotations", "write an annotation file");
  annotations->add_option("--file", file, "the annotation file")->required();
  annotations->add_option("--count", count, "annotated plug-ins (default 10000)")
      ->check(CLI::Range(1u, kMaxCount));

  std::string database;
  std::string kind = "find";
  unsigned limit = kMaxCount;
  auto* requests = app.add_subcommand("requests", "print a request per registered plug-in");
  requests->add_option("--registry", database, "registry.db of a stopped daemon")->required();
  requests->add_option("--kind", kind, "find, annotate or uuid")
      ->check(CLI::IsMember({"find", "annotate", "uuid"}));
  requests->add_option("--limit", limit, "at most this many")->check(CLI::Range(1u, kMaxCount));

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    int code = app.exit(e);
    return code == 0 ? kSuccess : kUsage;
  }
  bool ok = false;
  if (*plugIns) ok = writePlugIns(systemRoot, count, points);
  if (*annotations) ok = writeAnnotations(file, count);
  if (*requests) ok = printRequests(database, kind, limit);
  return ok ? kSuccess : kFailed;
}
