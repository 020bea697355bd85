// Runs the matching language on arbitrary CBOR: a map that may hold "rules" (a rules
// dictionary), "attributes", "extension" and "info" (what the plug-in declares), "entitlements",
// "annotation" and "items" (a host's item description). Matching must never crash, and its
// parts must agree: a rules dictionary matches exactly when each of its rules does, and an array
// value matches a pattern exactly when one of its string elements does.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <optional>
#include <span>
#include <string>

#include "ekd/EkDPlugIn.h"
#include "platform/cbor/Cbor.h"
#include "platform/log/Log.h"
#include "platform/types/TypeSystem.h"
#include "platform/vantor/FakeRegistry.h"

namespace {

class NullSink : public ek::log::Sink {
 public:
  void write(const ek::log::Record&) override {}
};

const ek::Dictionary* member(const ek::Dictionary& input, std::string_view key) {
  auto it = input.find(key);
  return it == input.end() ? nullptr : it->second.dictionary();
}

ek::Dictionary copyOf(const ek::Dictionary* dictionary) {
  return dictionary ? *dictionary : ek::Dictionary{};
}

struct Fixture {
  std::shared_ptr<ek::vantor::FakeRegistry> registry = std::make_shared<ek::vantor::FakeRegistry>();
  std::shared_ptr<ek::types::TypeSystem> types = std::make_shared<ek::types::TypeSystem>();
  std::optional<ek::Dictionary> annotation;
};

Fixture& fixture() {
  static Fixture* shared = [] {
    ek::log::setSink(std::make_shared<NullSink>());
    ek::log::configure("debug");  // format every log line too
    return new Fixture;
  }();
  return *shared;
}

// Installs the plug-in under uuid (the caller uninstalls it) and builds its record.
std::shared_ptr<ek::EkDPlugIn> plugInFor(const ek::Dictionary& input, const ek::Uuid& uuid) {
  Fixture& f = fixture();
  ek::vantor::PlugInProxy proxy;
  proxy.uuid = uuid;
  proxy.identifier = "com.example.fuzz";
  proxy.originalIdentifier = proxy.identifier;
  proxy.path = "/Applications/Fuzz.app/PlugIns/Fuzz.appex";
  proxy.url = ek::vantor::fileUrlForPath(proxy.path);
  proxy.containingAppPath = "/Applications/Fuzz.app";
  proxy.dataContainerPath = "/var/lib/ekora/containers/com.example.fuzz";
  proxy.entitlements = copyOf(member(input, "entitlements"));
  ek::Dictionary extension = copyOf(member(input, "extension"));
  extension.insert_or_assign("ZuExtensionPointIdentifier", "com.example.point");
  extension.insert_or_assign("ZuExtensionAttributes", copyOf(member(input, "attributes")));
  ek::Dictionary info = copyOf(member(input, "info"));
  info.insert_or_assign("QvBundleIdentifier", proxy.identifier);
  info.insert_or_assign("ZuExtension", std::move(extension));
  proxy.info = std::move(info);
  f.registry->install(proxy);

  ek::EkDPlugInContext context;
  context.registry = f.registry;
  context.systemRoot = "/System";
  context.types = f.types;
  context.annotations = [](const ek::EkDPlugIn&) { return fixture().annotation; };
  return ek::EkDPlugIn::createWithVRData(proxy, std::move(context));
}

bool isBoolean(const ek::Value& value) {
  return value.boolean() != nullptr;
}

// Rules against the plug-in: the whole and its parts agree.
void exerciseRules(const ek::EkDPlugIn& plugIn, const ek::Dictionary& rules) {
  bool every = true;
  for (const auto& [key, pattern] : rules) every = plugIn.matchKey(key, pattern) && every;
  if (plugIn.match(&rules) != every) abort();
}

// Each attribute against each pattern the input offers.
void exerciseAttributes(const ek::EkDPlugIn& plugIn, const ek::Dictionary& attributes,
                        const ek::Dictionary& rules, const ek::Dictionary* items) {
  for (const auto& [key, value] : attributes) {
    if (items != nullptr) (void)plugIn.matchDictionary(value, *items);
    for (const auto& [ignored, pattern] : rules) {
      const bool matched = plugIn.matchKey(key, pattern);
      const ek::Array* elements = value.array();
      if (elements == nullptr || isBoolean(pattern) || pattern.dictionary() != nullptr) continue;
      // Array values are matched through a summary of their strings; it must answer what
      // trying the strings one by one answers. Only checked for attributes the plug-in
      // resolves from its attributes (special keys resolve elsewhere).
      if (key == "ZuExtensionIdentifier" || key == "com.corvane.uuid" || key == "ZuUserElection" ||
          key == "ZuExtensionContainingApp" || key.starts_with("ENTITLEMENT:")) {
        continue;
      }
      bool any = false;
      for (const ek::Value& element : *elements) {
        if (const std::string* text = element.string()) {
          any = any || plugIn.matchValue(*text, pattern);
        }
      }
      if (matched != any) abort();
    }
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  Fixture& f = fixture();
  ek::Result<ek::Value> decoded = ek::cbor::decode(std::span<const uint8_t>(data, size));
  if (!decoded.ok() || decoded->dictionary() == nullptr) return 0;
  const ek::Dictionary& input = *decoded->dictionary();

  f.annotation.reset();
  if (const ek::Dictionary* annotation = member(input, "annotation")) f.annotation = *annotation;

  const ek::Uuid uuid = ek::Uuid::random();
  if (auto plugIn = plugInFor(input, uuid)) {
    const ek::Dictionary rules = copyOf(member(input, "rules"));
    const ek::Dictionary* items = member(input, "items");
    exerciseRules(*plugIn, rules);
    exerciseAttributes(*plugIn, copyOf(member(input, "attributes")), rules, items);
    if (items != nullptr) (void)plugIn->matchDictionary(ek::Value(rules), *items);
  }
  // The registry must not grow run after run.
  f.registry->uninstall(uuid);
  if (const ek::Dictionary* items = member(input, "items")) {
    if (auto rule = input.find("rule"); rule != input.end()) {
      (void)f.types->evaluateActivationRule(rule->second, *items);
    }
  }
  return 0;
}
