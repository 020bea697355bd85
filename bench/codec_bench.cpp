// Micro-benchmarks of the wire codecs on the two shapes the daemon handles most: a small
// request map, and a "match" reply carrying many plug-in forms.

#include <benchmark/benchmark.h>
#include <fmt/format.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "platform/cbor/Cbor.h"
#include "platform/json/WireJson.h"
#include "platform/value/Value.h"

namespace {

using ek::Array;
using ek::Dictionary;
using ek::Value;

constexpr size_t kFormCount = 500;

Value smallRequest() {
  return Dictionary{
      {"request", "match"},
      {"version", 3},
      {"flags", 0},
      {"rules", Dictionary{{"ZuExtensionPointIdentifier", "com.corvane.share-services"}}},
      {"paths", Array{"/opt/Photos.app/PlugIns/Share.appex"}},
      {"environment", Dictionary{}},
  };
}

// Shaped like an exported plug-in form with the keys discovery adds; values vary by index so
// that no two forms are byte-identical.
Value pluginForm(size_t i) {
  std::string app = fmt::format("Vendor{:03}", i % 97);
  std::string identifier = fmt::format("com.vendor{:03}.app.extension{}", i % 97, i);
  std::string path = fmt::format("/opt/{}.app/PlugIns/Extension{}.appex", app, i);
  ek::Uuid uuid{};
  for (size_t b = 0; b < uuid.bytes.size(); ++b) {
    uuid.bytes[b] = static_cast<uint8_t>((i * 31 + b * 7) & 0xff);
  }
  Dictionary info{
      {"ZuExtensionPointIdentifier",
       i % 3 == 0 ? "com.corvane.share-services" : "com.corvane.widget-kit"},
      {"ZuExtensionPrincipalClass", "ExtensionMain"},
      {"ZuExtensionAttributes",
       Dictionary{{"ZuExtensionActivationRule",
                   Dictionary{{"ZuExtensionActivationSupportsImageWithMaxCount", 10},
                              {"ZuExtensionActivationSupportsText", true}}},
                  {"ZuExtensionServiceAllowsFinderPreviewItem", i % 2 == 0},
                  {"ZuExtensionPointVersion", "1.0"}}},
  };
  Dictionary bundleInfo{
      {"QvBundleIdentifier", identifier},
      {"QvBundleName", fmt::format("Extension {}", i)},
      {"QvBundleDisplayName", fmt::format("Share to {}", app)},
      {"QvBundleVersion", fmt::format("{}.{}", 100 + i % 50, i % 7)},
      {"QvBundleShortVersionString", fmt::format("2.{}", i % 10)},
      {"QvBundleExecutable", "Extension"},
      {"QvBundlePackageType", "XPC!"},
  };
  return Dictionary{
      {"hubProtocolVersion", 3},
      {"path", path},
      {"systemResident", false},
      {"identifier", identifier},
      {"original-identifier", identifier},
      {"version", fmt::format("{}.{}", 100 + i % 50, i % 7)},
      {"bundleInfo", bundleInfo},
      {"info", info},
      {"uuid", uuid.string()},
      {"lastmodified", static_cast<uint64_t>(1700000000 + i)},
      {"annotations", Dictionary{{"election", i % 2}, {"extension", Dictionary{}}}},
      {"entitlements",
       Dictionary{{"com.corvane.security.app-sandbox", true},
                  {"com.corvane.security.application-groups", Array{"group." + identifier}}}},
      {"containingPath", fmt::format("/opt/{}.app", app)},
      {"localizedDisplayName", fmt::format("Share to {}", app)},
      {"localizedShortName", app},
      {"extensions",
       Dictionary{{path, fmt::format("{:064x};00;00000000;{}", i * 2654435761u, path)}}},
  };
}

Value manyForms() {
  Array forms;
  forms.reserve(kFormCount);
  for (size_t i = 0; i < kFormCount; ++i) forms.push_back(pluginForm(i));
  return Dictionary{{"matches", std::move(forms)}};
}

const Value& request() {
  static const Value value = smallRequest();
  return value;
}

const Value& forms() {
  static const Value value = manyForms();
  return value;
}

void encodeCbor(benchmark::State& state, const Value& value) {
  std::vector<uint8_t> out;
  for (auto _ : state) {
    out.clear();
    ek::cbor::encode(value, out);
    benchmark::DoNotOptimize(out.data());
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * out.size()));
  state.counters["bytes"] = static_cast<double>(out.size());
}

void decodeCbor(benchmark::State& state, const Value& value) {
  std::vector<uint8_t> bytes = ek::cbor::encode(value);
  for (auto _ : state) {
    ek::Result<Value> decoded = ek::cbor::decode(bytes);
    if (!decoded) {
      state.SkipWithError("CBOR decode failed");
      break;
    }
    benchmark::DoNotOptimize(decoded);
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * bytes.size()));
}

void writeJson(benchmark::State& state, const Value& value) {
  size_t size = 0;
  for (auto _ : state) {
    std::string text = ek::wirejson::write(value);
    size = text.size();
    benchmark::DoNotOptimize(text.data());
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * size));
  state.counters["bytes"] = static_cast<double>(size);
}

void parseJson(benchmark::State& state, const Value& value) {
  std::string text = ek::wirejson::write(value);
  for (auto _ : state) {
    ek::Result<Value> parsed = ek::wirejson::parse(text);
    if (!parsed) {
      state.SkipWithError("wire JSON parse failed");
      break;
    }
    benchmark::DoNotOptimize(parsed);
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * text.size()));
}

void BM_CborEncodeRequest(benchmark::State& state) {
  encodeCbor(state, request());
}
void BM_CborDecodeRequest(benchmark::State& state) {
  decodeCbor(state, request());
}
void BM_CborEncode500Forms(benchmark::State& state) {
  encodeCbor(state, forms());
}
void BM_CborDecode500Forms(benchmark::State& state) {
  decodeCbor(state, forms());
}
void BM_WireJsonWriteRequest(benchmark::State& state) {
  writeJson(state, request());
}
void BM_WireJsonParseRequest(benchmark::State& state) {
  parseJson(state, request());
}
void BM_WireJsonWrite500Forms(benchmark::State& state) {
  writeJson(state, forms());
}
void BM_WireJsonParse500Forms(benchmark::State& state) {
  parseJson(state, forms());
}

BENCHMARK(BM_CborEncodeRequest);
BENCHMARK(BM_CborDecodeRequest);
BENCHMARK(BM_CborEncode500Forms)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_CborDecode500Forms)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_WireJsonWriteRequest);
BENCHMARK(BM_WireJsonParseRequest);
BENCHMARK(BM_WireJsonWrite500Forms)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_WireJsonParse500Forms)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
