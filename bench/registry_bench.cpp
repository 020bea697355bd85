// Vantor registry figures: registering a large installation, proxy lookup against a bare
// SQLite point lookup on the same file, and a query of one well-populated extension point.
//
// The tree: 500 applications with 20 plug-ins each (10,000 plug-ins); plug-in j of every
// application serves extension point com.bench.point<j>, so each point holds 500 plug-ins.

#include <benchmark/benchmark.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <random>

#include "platform/dmap/Dmap.h"
#include "platform/vantor/SqliteRegistry.h"

namespace {

namespace fs = std::filesystem;
using ek::Dictionary;
using ek::Value;

constexpr int kApplications = 500;
constexpr int kPlugInsPerApplication = 20;

void writeFile(const std::string& path, std::string_view bytes, mode_t mode = 0644) {
  std::ofstream(path, std::ios::binary | std::ios::trunc) << bytes;
  chmod(path.c_str(), mode);
}

void writeDmap(const std::string& path, const Dictionary& dictionary) {
  auto text = ek::dmap::write(Value(dictionary));
  if (!text.ok()) std::abort();
  writeFile(path, *text);
}

struct Tree {
  std::string root;
  std::string state;
  std::string system;
  std::vector<std::string> applications;

  Tree() {
    char pattern[] = "/tmp/registry-bench-XXXXXX";
    if (mkdtemp(pattern) == nullptr) std::abort();
    root = pattern;
    state = root + "/state";
    system = root + "/System";
    fs::create_directories(system + "/Library/ExtensionPoints");
    for (int j = 0; j < kPlugInsPerApplication; ++j) {
      writeDmap(
          system + "/Library/ExtensionPoints/com.bench.point" + std::to_string(j) + ".dmap",
          {{"ZuExtension", Value(Dictionary{{"ZuExtensionProtocol", Value("BenchService")},
                                            {"ZuExtensionAttributes",
                                             Value(Dictionary{{"BenchDefault", Value(1)}})}})}});
    }
    for (int a = 0; a < kApplications; ++a) {
      std::string app = root + "/Applications/App" + std::to_string(a) + ".app";
      fs::create_directories(app + "/en.lproj");
      writeDmap(app + "/Info.dmap",
                {{"QvBundleIdentifier", Value("com.bench.app" + std::to_string(a))},
                 {"QvBundleName", Value("App " + std::to_string(a))},
                 {"QvBundleExecutable", Value("App")}});
      writeFile(app + "/App", "#!/bin/sh\n", 0755);
      for (int j = 0; j < kPlugInsPerApplication; ++j) {
        std::string name = "P" + std::to_string(j);
        std::string plugIn = app + "/PlugIns/" + name + ".appex";
        fs::create_directories(plugIn + "/en.lproj");
        std::string identifier = "com.bench.app" + std::to_string(a) + "." + name;
        writeDmap(
            plugIn + "/Info.dmap",
            {{"QvBundleIdentifier", Value(identifier)},
             {"QvBundleVersion", Value("1.0")},
             {"QvBundleName", Value(name)},
             {"QvBundleExecutable", Value(name)},
             {"ZuExtension",
              Value(Dictionary{
                  {"ZuExtensionPointIdentifier", Value("com.bench.point" + std::to_string(j))},
                  {"ZuExtensionAttributes",
                   Value(Dictionary{{"ZuExtensionVersion", Value("1.0")},
                                    {"BenchTypes", Value(ek::Array{Value("public.image"),
                                                                   Value("public.text")})}})}})}});
        writeDmap(plugIn + "/en.lproj/InfoDmap.strings",
                  {{"QvBundleDisplayName", Value("Plug-in " + identifier)}});
        writeFile(plugIn + "/" + name, "#!/bin/sh\n", 0755);
      }
      applications.push_back(app);
    }
  }
  ~Tree() { fs::remove_all(root); }
};

// One tree, one database, shared by the benchmarks of the run in the order they are declared.
struct Fixture {
  Tree tree;
  std::shared_ptr<ek::vantor::SqliteRegistry> registry;
  std::vector<ek::Uuid> uuids;

  ek::vantor::SqliteRegistry::Options options() const {
    ek::vantor::SqliteRegistry::Options options;
    options.stateDir = tree.state;
    options.systemRoot = tree.system;
    return options;
  }
  ek::vantor::SqliteRegistry& open() {
    if (!registry) {
      auto opened = ek::vantor::SqliteRegistry::open(options());
      if (!opened.ok()) {
        std::fprintf(stderr, "open: %s\n", opened.error().message.c_str());
        std::abort();
      }
      registry = opened.value();
    }
    return *registry;
  }
  void close() { registry.reset(); }
};

Fixture& fixture() {
  static Fixture* instance = new Fixture();
  return *instance;
}

void BM_RegisterTenThousandPlugIns(benchmark::State& state) {
  Fixture& f = fixture();
  for (auto _ : state) {
    f.close();
    fs::remove_all(f.tree.state);
    auto& registry = f.open();
    auto start = std::chrono::steady_clock::now();
    for (const std::string& app : f.tree.applications) {
      if (!registry.registerBundle(app).ok()) std::abort();
    }
    state.SetIterationTime(
        std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count());
  }
  f.uuids.clear();
  for (const auto& proxy : f.open().installedPlugIns()) f.uuids.push_back(proxy->uuid);
  if (f.uuids.size() != kApplications * kPlugInsPerApplication) std::abort();
  state.counters["plugins"] = static_cast<double>(f.uuids.size());
  state.counters["plugins/s"] = benchmark::Counter(
      static_cast<double>(f.uuids.size()) * static_cast<double>(state.iterations()),
      benchmark::Counter::kIsRate);
}
BENCHMARK(BM_RegisterTenThousandPlugIns)
    ->Iterations(1)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond);

void BM_ProxyByUuid(benchmark::State& state) {
  Fixture& f = fixture();
  auto& registry = f.open();
  std::mt19937 random(42);
  std::uniform_int_distribution<size_t> pick(0, f.uuids.size() - 1);
  for (auto _ : state) {
    auto proxy = registry.plugInByUuid(f.uuids[pick(random)]);
    if (!proxy) std::abort();
    benchmark::DoNotOptimize(proxy);
  }
}
BENCHMARK(BM_ProxyByUuid);

// The same row read by a bare prepared statement: the floor under the proxy lookup. The
// registry holds the file exclusively, so it is closed for this one.
void BM_RawSqlitePointLookup(benchmark::State& state) {
  Fixture& f = fixture();
  f.close();
  sqlite3* db = nullptr;
  if (sqlite3_open_v2((f.tree.state + "/registry.db").c_str(), &db, SQLITE_OPEN_READONLY,
                      nullptr) != SQLITE_OK) {
    std::abort();
  }
  sqlite3_exec(db, "PRAGMA cache_size=-32768", nullptr, nullptr, nullptr);
  sqlite3_stmt* statement = nullptr;
  sqlite3_prepare_v2(db,
                     "SELECT uuid, path, identifier, original_identifier, version, app_path, "
                     "point, info, sdk, entitlements, registered, container, strings "
                     "FROM plugins WHERE uuid = ?1",
                     -1, &statement, nullptr);
  std::mt19937 random(42);
  std::uniform_int_distribution<size_t> pick(0, f.uuids.size() - 1);
  for (auto _ : state) {
    sqlite3_bind_blob(statement, 1, f.uuids[pick(random)].bytes.data(), 16, SQLITE_STATIC);
    if (sqlite3_step(statement) != SQLITE_ROW) std::abort();
    size_t bytes = 0;
    for (int column = 0; column < 13; ++column) {
      bytes += static_cast<size_t>(sqlite3_column_bytes(statement, column));
    }
    benchmark::DoNotOptimize(bytes);
    sqlite3_reset(statement);
  }
  sqlite3_finalize(statement);
  sqlite3_close(db);
}
BENCHMARK(BM_RawSqlitePointLookup);

void BM_QueryOneExtensionPoint(benchmark::State& state) {
  Fixture& f = fixture();
  auto& registry = f.open();
  Dictionary rules{{"ZuExtensionPointIdentifier", Value("com.bench.point7")}};
  size_t found = 0;
  for (auto _ : state) {
    auto proxies = registry.query(rules, {});
    found = proxies.size();
    benchmark::DoNotOptimize(proxies);
  }
  if (found != kApplications) std::abort();
  state.counters["plugins"] = static_cast<double>(found);
}
BENCHMARK(BM_QueryOneExtensionPoint)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
