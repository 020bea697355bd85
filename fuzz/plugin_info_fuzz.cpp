// Reads arbitrary wire JSON as a plug-in form and as a bundle info dictionary. Every form that
// is accepted, and every info dictionary that sets up and validates, must export to a form that
// reads back and exports again to the very same form.
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>
#include <string_view>

#include "Ekora/EkCollections.h"
#include "Ekora/EkPlugInCore.h"
#include "fuzz/SameValue.h"
#include "platform/json/WireJson.h"
#include "platform/log/Log.h"

namespace {

class NullSink : public ek::log::Sink {
 public:
  void write(const ek::log::Record&) override {}
};

void requireFormReadsBack(const ek::EkPlugInCore& record) {
  ek::Dictionary form = record.exportForm().form;
  auto again = ek::EkPlugInCore::createWithForm(form);
  if (!again.ok()) abort();
  if (!(again.value()->uuid() == record.uuid())) abort();
  if (!ek::fuzz::sameValue(ek::Value(again.value()->exportForm().form), ek::Value(form))) {
    abort();
  }
}

void exerciseInfo(const ek::Value& info, std::string_view path) {
  const std::string* identifier = info.getString("QvBundleIdentifier");
  auto url = ek::EkFileURL::fromPath(path);
  auto record = ek::EkPlugInCore::createWithName(
      identifier ? std::optional<std::string>(*identifier) : std::nullopt, url.value(), &info,
      nullptr, std::nullopt);
  if (!record) return;
  (void)record->isDedicated();
  (void)record->isData();
  (void)record->localizedInfoDictionaryForKeys({"QvBundleName", "QvBundleDisplayName"});
  record->resolveSDK();
  if (record->diagnose()) return;
  if (auto version = record->versionString()) {
    (void)ek::compareVersionString(*version, "1.10.2");
  }
  record->setOriginalIdentifier(*identifier);
  record->setLocalizedName("Fuzzed Name");
  record->setAnnotations(std::make_shared<const ek::Dictionary>());
  record->setAnnotation("election", ek::Value(1));
  requireFormReadsBack(*record);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const bool quiet = [] {
    ek::log::setSink(std::make_shared<NullSink>());
    return true;
  }();
  (void)quiet;

  auto parsed = ek::wirejson::parse(std::string_view(reinterpret_cast<const char*>(data), size));
  if (!parsed.ok() || parsed->dictionary() == nullptr) return 0;
  const ek::Dictionary& dictionary = *parsed->dictionary();

  if (auto record = ek::EkPlugInCore::createWithForm(dictionary); record.ok()) {
    requireFormReadsBack(*record.value());
  }
  exerciseInfo(*parsed, "/apps/Fuzz.app/PlugIns/Fuzz.appex");
  exerciseInfo(*parsed, "/System/Library/PlugIns/Fuzz.bundle");
  (void)ek::EkPlugInCore::mergeDictionary(dictionary, dictionary);
  return 0;
}
