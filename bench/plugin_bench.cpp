// The daemon's plug-in record: building it from a registry proxy and exporting its form.
#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <filesystem>

#include "Ekora/EkSandbox.h"
#include "Ekora/EkSandboxKey.h"
#include "ekd/EkDPlugIn.h"
#include "platform/vantor/SqliteRegistry.h"

namespace {

namespace fs = std::filesystem;
using namespace ek;

struct Fixture {
  fs::path dir;
  std::shared_ptr<vantor::SqliteRegistry> registry;
  vantor::PlugInProxyPtr proxy;
  EkDPlugInContext context;

  Fixture() {
    char pattern[] = "/tmp/ekora-plugin-bench-XXXXXX";
    dir = mkdtemp(pattern);
    fs::create_directories(dir / "System");
    vantor::SqliteRegistry::Options options;
    options.stateDir = (dir / "state").string();
    options.databasePath = (dir / "state/registry.db").string();
    options.systemRoot = (dir / "System").string();
    fs::create_directories(options.stateDir);
    registry = vantor::SqliteRegistry::open(options).value();
    std::string app = std::string(EXAMPLES_DIR) + "/Applications/Viewer.app";
    if (!registry->registerBundle(app)) std::abort();
    proxy = registry->plugInByUrl(app + "/PlugIns/Thumbs.appex");
    if (!proxy) std::abort();
    context = {registry, std::make_shared<EkSandbox>(EkSandboxMemoryKeySource::random()),
               options.systemRoot};
  }
  ~Fixture() {
    registry.reset();
    fs::remove_all(dir);
  }
};

Fixture& fixture() {
  static Fixture* shared = new Fixture();
  return *shared;
}

void BM_EkDPlugInFromProxy(benchmark::State& state) {
  Fixture& f = fixture();
  for (auto _ : state) {
    auto plugIn = EkDPlugIn::createWithVRData(*f.proxy, f.context);
    if (!plugIn) state.SkipWithError("the record could not be built");
    benchmark::DoNotOptimize(plugIn);
  }
}
BENCHMARK(BM_EkDPlugInFromProxy);

void BM_EkDPlugInExportForm(benchmark::State& state) {
  Fixture& f = fixture();
  auto plugIn = EkDPlugIn::createWithVRData(*f.proxy, f.context);
  for (auto _ : state) {
    auto form = plugIn->exportForm();
    benchmark::DoNotOptimize(form);
  }
}
BENCHMARK(BM_EkDPlugInExportForm);

void BM_RegistryProxyByUrl(benchmark::State& state) {
  Fixture& f = fixture();
  std::string url = f.proxy->path;
  for (auto _ : state) benchmark::DoNotOptimize(f.registry->plugInByUrl(url));
}
BENCHMARK(BM_RegistryProxyByUrl);

}  // namespace

BENCHMARK_MAIN();
