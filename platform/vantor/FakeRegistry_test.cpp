#include "platform/vantor/FakeRegistry.h"

#include <gtest/gtest.h>

namespace ek::vantor {
namespace {

PlugInProxy proxy(std::string identifier, std::string point, std::string path) {
  PlugInProxy p;
  p.uuid = Uuid::random();
  p.identifier = identifier;
  p.originalIdentifier = identifier;
  p.path = std::move(path);
  p.extensionPoint = point;
  p.info = {{"QvBundleIdentifier", Value(identifier)},
            {"ZuExtension",
             Value(Dictionary{{"ZuExtensionPointIdentifier", Value(point)},
                              {"ZuExtensionAttributes",
                               Value(Dictionary{{"ZuExtensionPointIdentifier", Value(point)}})}})}};
  return p;
}

class Counter : public RegistryObserver {
 public:
  explicit Counter(Registry& registry) : registry_(registry) {}
  void pluginsDidInstall(const std::vector<PlugInProxyPtr>& plugIns) override {
    installs += static_cast<int>(plugIns.size());
  }
  void pluginsWillUninstall(const std::vector<PlugInProxyPtr>& plugIns) override {
    for (const auto& plugIn : plugIns) readableOnUninstall = !!registry_.plugInByUuid(plugIn->uuid);
    uninstalls += static_cast<int>(plugIns.size());
  }
  void localeDidChange() override { ++locales; }
  Registry& registry_;
  int installs = 0, uninstalls = 0, locales = 0;
  bool readableOnUninstall = false;
};

TEST(FakeRegistry, InstalledProxiesAreFoundAndNoticed) {
  FakeRegistry registry;
  auto counter = std::make_shared<Counter>(registry);
  registry.addObserver(counter);
  PlugInProxy a = proxy("com.a", "p", "/Apps/X.app/PlugIns/A.appex");
  a.containingAppPath = "/Apps/X.app";
  Uuid knowledge = registry.knowledgeUuid();
  registry.install(a);
  EXPECT_NE(registry.knowledgeUuid(), knowledge);
  EXPECT_EQ(registry.plugInByUuid(a.uuid)->identifier, "com.a");
  EXPECT_EQ(registry.plugInByUrl("file:///Apps/X.app/PlugIns/A.appex/")->uuid, a.uuid);
  EXPECT_EQ(registry.plugInsOfApplication("/Apps/X.app").size(), 1u);
  EXPECT_TRUE(registry.uninstall(a.uuid));
  EXPECT_FALSE(registry.uninstall(a.uuid));
  registry.changeLocale();
  registry.queue()->sync([] {});
  EXPECT_EQ(counter->installs, 1);
  EXPECT_EQ(counter->uninstalls, 1);
  EXPECT_EQ(counter->locales, 1);
  EXPECT_TRUE(counter->readableOnUninstall);
  EXPECT_FALSE(registry.plugInByUuid(a.uuid));
}

TEST(FakeRegistry, QueryNarrowsByExtensionPointLikeTheRealRegistry) {
  FakeRegistry registry;
  registry.install(proxy("com.a", "share", "/a"));
  registry.install(proxy("com.b", "thumb", "/b"));
  registry.install(proxy("com.c", "edit", "/c"));
  EXPECT_EQ(registry.query({{"ZuExtensionPointIdentifier", Value("share")}}, {}).size(), 1u);
  EXPECT_EQ(
      registry
          .query({{"ZuExtensionPointIdentifier", Value(Array{Value("share"), Value("edit")})}}, {})
          .size(),
      2u);
  EXPECT_EQ(registry.query({{"ZuExtensionPointIdentifier", Value("=share")}}, {}).size(), 3u);
  auto filtered = registry.query({}, [](const PlugInProxy& p) { return p.identifier == "com.c"; });
  ASSERT_EQ(filtered.size(), 1u);
  EXPECT_EQ(filtered[0]->identifier, "com.c");
}

TEST(FakeRegistry, RegistrationAnswersWhatTheTestSet) {
  FakeRegistry registry;
  EXPECT_TRUE(registry.registerBundle("/x.appex").ok());
  registry.setUnregisterResult(makeError(kNotRegistered, "no"));
  EXPECT_FALSE(registry.unregisterBundle("/y.appex").ok());
  EXPECT_EQ(registry.registeredPaths(), std::vector<std::string>{"/x.appex"});
  EXPECT_EQ(registry.unregisteredPaths(), std::vector<std::string>{"/y.appex"});
}

TEST(FakeRegistry, ApplicationsAndStringsAreAnsweredAsInserted) {
  FakeRegistry registry;
  ApplicationProxy app;
  app.identifier = "com.app";
  app.path = "/Apps/X.app";
  registry.addApplication(app);
  EXPECT_EQ(registry.applicationByIdentifier("com.app")->path, "/Apps/X.app");
  EXPECT_EQ(registry.applicationByPath("file:///Apps/X.app")->identifier, "com.app");
  Uuid uuid = Uuid::random();
  registry.setLocalizedStrings(uuid, "Localizable", {{"Rename", Value("Umbenennen")}});
  EXPECT_EQ(registry.localizedStrings(uuid, "Localizable", {"Rename", "Other"}),
            (Dictionary{{"Rename", Value("Umbenennen")}}));
  registry.setExtensionPointSdk("share", {{"K", Value(1)}});
  EXPECT_EQ(registry.extensionPointSdk("share")->at("K"), Value(1));
  registry.clearCaches();
  EXPECT_EQ(registry.clearCachesCount(), 1);
}

}  // namespace
}  // namespace ek::vantor
