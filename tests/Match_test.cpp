// Discovery on a running daemon: the "match" request, its rules, flags, de-duplication,
// host-specific filters, global exclusions and replacement marking, asked by hand, through
// ekctl and through copies of ekctl placed as the executables of host applications.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <fstream>
#include <set>
#include <sstream>
#include <thread>

#include "platform/dmap/Dmap.h"
#include "platform/json/WireJson.h"
#include "platform/value/Uuid.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;
using Names = std::multiset<std::string>;

constexpr const char* kPoint = "com.test.match.point";
constexpr const char* kOtherPoint = "com.test.match.other";
constexpr const char* kManager = "com.corvane.private.ekora.manager";
constexpr const char* kAllowedPlugIns = "com.corvane.developer.ekora.allowedplugins";
constexpr const char* kReplace = "com.corvane.developer.replace-plugin";
constexpr const char* kPrefsDomain = "com.corvane.ekora.userprefs";
constexpr uint64_t kKeepVersions = 0x1;
constexpr uint64_t kKeepDuplicates = 0x4;
constexpr uint64_t kSystemOnly = 0x8;
constexpr uint64_t kDiscoverAll = 0x200;

// ---- Bundles on disk ---------------------------------------------------------------------------

void writeDmap(const fs::path& path, const Dictionary& dictionary) {
  auto written = dmap::writeFileAtomically(path.string(), Value(dictionary), 0644);
  ASSERT_TRUE(written.ok()) << path << ": " << written.error().message;
}

void writeScript(const fs::path& path) {
  std::ofstream(path) << "#!/bin/sh\nexit 0\n";
  chmod(path.c_str(), 0755);
}

struct PlugInLayout {
  std::string name;  // bundle <name>.appex, executable <name>
  std::string identifier;
  std::optional<std::string> version = "1.0";  // "ZuExtensionVersion"
  std::string point = kPoint;
  Dictionary attributes;
  Dictionary extension;  // further "ZuExtension" keys
  Dictionary info;       // further top-level info keys
  std::optional<Dictionary> entitlements;
};

fs::path writePlugIn(const fs::path& parent, const PlugInLayout& layout) {
  fs::path bundle = parent / (layout.name + ".appex");
  fs::create_directories(bundle);
  Dictionary attributes = layout.attributes;
  if (layout.version) attributes.insert_or_assign("ZuExtensionVersion", Value(*layout.version));
  Dictionary extension = layout.extension;
  extension.insert_or_assign("ZuExtensionPointIdentifier", Value(layout.point));
  extension.insert_or_assign("ZuExtensionAttributes", Value(std::move(attributes)));
  Dictionary info = layout.info;
  info.insert_or_assign("QvBundleIdentifier", Value(layout.identifier));
  info.insert_or_assign("QvBundleName", Value(layout.name));
  info.insert_or_assign("QvBundleExecutable", Value(layout.name));
  info.insert_or_assign("QvBundleVersion", Value(layout.version.value_or("1")));
  info.insert_or_assign("ZuExtension", Value(std::move(extension)));
  writeDmap(bundle / "Info.dmap", info);
  writeScript(bundle / layout.name);
  if (layout.entitlements)
    writeDmap(bundle / (layout.name + ".entitlements"), *layout.entitlements);
  return bundle;
}

struct AppLayout {
  std::string name;  // bundle <name>.app, executable <name>
  std::vector<PlugInLayout> plugIns;
  bool host = false;  // the executable is a copy of ekctl, so the app can ask the daemon
  std::optional<Dictionary> entitlements;  // of the executable
};

fs::path writeApp(const fs::path& parent, const AppLayout& layout) {
  fs::path bundle = parent / (layout.name + ".app");
  fs::create_directories(bundle / "PlugIns");
  std::string lower = layout.name;
  std::transform(lower.begin(), lower.end(), lower.begin(), ::tolower);
  writeDmap(bundle / "Info.dmap", {{"QvBundleIdentifier", Value("com.test.app." + lower)},
                                   {"QvBundleName", Value(layout.name)},
                                   {"QvBundleExecutable", Value(layout.name)}});
  fs::path executable = bundle / layout.name;
  if (layout.host) {
    fs::copy_file(ekctlPath(), executable, fs::copy_options::overwrite_existing);
    chmod(executable.c_str(), 0755);
  } else {
    writeScript(executable);
  }
  if (layout.entitlements) writeDmap(executable.string() + ".entitlements", *layout.entitlements);
  for (const PlugInLayout& plugIn : layout.plugIns) writePlugIn(bundle / "PlugIns", plugIn);
  return bundle;
}

// A copy of ekctl in dir whose entitlements are exactly the given dictionary.
std::string ekctlCopy(const fs::path& dir, const Dictionary& entitlements) {
  fs::create_directories(dir);
  fs::path program = dir / "ekctl";
  fs::copy_file(ekctlPath(), program, fs::copy_options::overwrite_existing);
  chmod(program.c_str(), 0755);
  writeDmap(program.string() + ".entitlements", entitlements);
  return program.string();
}

Value json(const std::string& text) {
  auto value = wirejson::parse(text);
  EXPECT_TRUE(value.ok()) << text << ": " << value.error().message;
  return value.ok() ? std::move(value).value() : Value();
}

Dictionary pointRules(std::string_view point = kPoint) {
  return Dictionary{{"ZuExtensionPointIdentifier", Value(point)}};
}

// ---- Replies ------------------------------------------------------------------------------------

std::string stringAt(const Dictionary& form, std::string_view key) {
  auto it = form.find(key);
  if (it == form.end() || !it->second.string()) return "<absent>";
  return *it->second.string();
}

// The forms of a successful version-3 match reply; a failure when the reply is anything else.
std::vector<Dictionary> formsOf(const Value& reply) {
  std::vector<Dictionary> forms;
  EXPECT_EQ(replyErrorCode(reply), 0) << reply.description();
  const Array* matches = reply.getArray("matches");
  EXPECT_NE(matches, nullptr) << reply.description();
  if (!matches) return forms;
  for (const Value& form : *matches) {
    EXPECT_NE(form.dictionary(), nullptr) << form.description();
    if (form.dictionary()) forms.push_back(*form.dictionary());
  }
  return forms;
}

Names identifiersOf(const Value& reply) {
  Names names;
  for (const Dictionary& form : formsOf(reply)) names.insert(stringAt(form, "identifier"));
  return names;
}

Names pathsOf(const Value& reply) {
  Names paths;
  for (const Dictionary& form : formsOf(reply)) paths.insert(stringAt(form, "path"));
  return paths;
}

// The one form of the reply for that identifier; a failure when there is not exactly one.
Dictionary formFor(const Value& reply, const std::string& identifier) {
  std::vector<Dictionary> found;
  for (Dictionary& form : formsOf(reply)) {
    if (stringAt(form, "identifier") == identifier) found.push_back(std::move(form));
  }
  EXPECT_EQ(found.size(), 1u) << identifier << " in " << reply.description();
  return found.empty() ? Dictionary{} : found.front();
}

class MatchRequests : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = fs::canonical(daemon_.root().path());
    apps_ = root_ / "Applications";
    systemPlugIns_ = root_ / "System/Library/PlugIns";
    fs::create_directories(apps_);
    fs::create_directories(systemPlugIns_);
  }
  void TearDown() override {
    if (daemon_.running()) {
      EXPECT_EQ(daemon_.terminate(), 0) << daemon_.log();
    }
  }

  void start() { ASSERT_TRUE(daemon_.start()) << daemon_.log(); }

  void add(const fs::path& bundle) {
    auto reply = daemon_.ask(request("add", {{"paths", Value(Array{Value(bundle.string())})}}));
    ASSERT_TRUE(reply.has_value()) << daemon_.log();
    ASSERT_EQ(replyErrorCode(*reply), 0) << reply->description() << "\n" << daemon_.log();
  }
  fs::path addApp(const AppLayout& layout) {
    fs::path bundle = writeApp(apps_, layout);
    add(bundle);
    return bundle;
  }
  fs::path systemPlugIn(const PlugInLayout& layout) { return writePlugIn(systemPlugIns_, layout); }

  Value ask(const Value& message) {
    auto reply = daemon_.ask(message);
    EXPECT_TRUE(reply.has_value()) << "no reply to " << message.description() << "\n"
                                   << daemon_.log();
    return reply ? *reply : Value(Dictionary{{"errorcode", Value(uint64_t{999})}});
  }
  // A match from this test process, which has no bundle and no entitlements.
  Value match(std::optional<Dictionary> rules, std::optional<uint64_t> flags = std::nullopt) {
    Dictionary extra;
    if (rules) extra.emplace("rules", Value(std::move(*rules)));
    if (flags) extra.emplace("flags", Value(*flags));
    return ask(request("match", std::move(extra)));
  }
  Value matchPoint(uint64_t flags = 0) { return match(pointRules(), flags); }

  // A match through another ekctl binary; the reply as it printed it.
  Value matchAs(const std::string& program, const Dictionary& rules, uint64_t flags = 0) {
    auto result = daemon_.ekctlAs(program, {"--json", "match", "--flags", std::to_string(flags),
                                            wirejson::write(Value(rules))});
    return parseOutput(result);
  }
  Value matchSandboxed(const std::string& program, const Dictionary& rules, uint64_t flags) {
    auto result =
        runCommand({sandboxExecPath(), program, "-S", daemon_.service(), "--json", "match",
                    "--flags", std::to_string(flags), wirejson::write(Value(rules))},
                   daemon_.environment());
    return parseOutput(result);
  }
  static Value parseOutput(const CommandResult& result) {
    auto value = wirejson::parse(result.out);
    EXPECT_TRUE(value.ok()) << "status " << result.status << " out: " << result.out
                            << " err: " << result.err;
    if (!value.ok()) return Value(Dictionary{{"errorcode", Value(uint64_t{999})}});
    if (result.status != 0) {
      EXPECT_NE(result.err.find("ekctl: error " + std::to_string(replyErrorCode(*value)) + ": " +
                                replyError(*value)),
                std::string::npos)
          << result.err;
    }
    return std::move(value).value();
  }

  std::string uuidOf(const fs::path& bundle) {
    Value reply = ask(request("find", {{"paths", Value("file://" + bundle.string())}}));
    const Value* form = reply.get("matches");
    const std::string* uuid = form ? form->getString("uuid") : nullptr;
    EXPECT_NE(uuid, nullptr) << bundle << ": " << reply.description() << "\n" << daemon_.log();
    return uuid ? *uuid : std::string("<no uuid>");
  }

  std::string logSince(size_t offset) const {
    std::string log = daemon_.log();
    return offset < log.size() ? log.substr(offset) : std::string();
  }
  // The log lines that hold every one of the pieces.
  std::vector<std::string> logLines(std::initializer_list<std::string> pieces,
                                    size_t offset = 0) const {
    std::vector<std::string> lines;
    std::istringstream in(logSince(offset));
    for (std::string line; std::getline(in, line);) {
      if (std::all_of(pieces.begin(), pieces.end(),
                      [&](const std::string& piece) { return line.find(piece) != line.npos; })) {
        lines.push_back(line);
      }
    }
    return lines;
  }

  static void expectFailure(const Value& reply, int64_t code, const std::string& message) {
    EXPECT_EQ(replyErrorCode(reply), code) << reply.description();
    EXPECT_EQ(replyError(reply), message);
    EXPECT_EQ(reply.get("matches"), nullptr) << reply.description();
  }

  EkdProcess daemon_;
  fs::path root_;
  fs::path apps_;
  fs::path systemPlugIns_;
};

// ---- Rules --------------------------------------------------------------------------------------

TEST_F(MatchRequests, ExtensionPointRuleSelectsThatPointsPlugIns) {
  ASSERT_NO_FATAL_FAILURE(start());
  addApp({"Tools",
          {{"A", "com.test.a"}, {"B", "com.test.b"}, {"C", "com.test.c", "1.0", kOtherPoint}}});
  EXPECT_EQ(identifiersOf(matchPoint()), (Names{"com.test.a", "com.test.b"}));
  EXPECT_EQ(identifiersOf(match(pointRules(kOtherPoint))), (Names{"com.test.c"}));
}

TEST_F(MatchRequests, NoMatchingPlugInIsASuccessWithAnEmptyList) {
  ASSERT_NO_FATAL_FAILURE(start());
  addApp({"Tools", {{"A", "com.test.a"}}});
  Value reply = match(pointRules("com.test.match.nobody"));
  ASSERT_EQ(replyErrorCode(reply), 0) << reply.description();
  const Array* matches = reply.getArray("matches");
  ASSERT_NE(matches, nullptr) << reply.description();
  EXPECT_TRUE(matches->empty());
}

TEST_F(MatchRequests, WithoutRulesEveryPlugInIsSelected) {
  ASSERT_NO_FATAL_FAILURE(start());
  addApp({"Tools", {{"A", "com.test.a"}, {"C", "com.test.c", "1.0", kOtherPoint}}});
  Names all{"com.test.a", "com.test.c"};
  EXPECT_EQ(identifiersOf(match(std::nullopt)), all);
  EXPECT_EQ(identifiersOf(match(Dictionary{})), all);
}

TEST_F(MatchRequests, AbsentFlagsAndUnlistedFlagBitsChangeNothing) {
  ASSERT_NO_FATAL_FAILURE(start());
  addApp({"Tools", {{"A", "com.test.a"}, {"B", "com.test.b"}}});
  Names expected{"com.test.a", "com.test.b"};
  EXPECT_EQ(identifiersOf(match(pointRules())), expected);
  EXPECT_EQ(identifiersOf(match(pointRules(), 0x2 | 0x10 | 0x100 | (uint64_t{1} << 40))), expected);
}

TEST_F(MatchRequests, RulesThatAreNotADictionaryAreAnInvalidRequestFormat) {
  ASSERT_NO_FATAL_FAILURE(start());
  addApp({"Tools", {{"A", "com.test.a"}}});
  for (const Value& rules : {Value(kPoint), Value(Array{Value(kPoint)}), Value(7)}) {
    expectFailure(ask(request("match", {{"rules", rules}})), 4,
                  "invalid request format (bad rules dictionary)");
  }
  // The rules are read before the flags are judged.
  expectFailure(ask(request("match", {{"rules", Value("x")}, {"flags", Value(kDiscoverAll)}})), 4,
                "invalid request format (bad rules dictionary)");
}

struct RuleCase {
  const char* name;
  const char* rules;  // wire JSON, added to the extension point rule
  Names expected;
};

TEST_F(MatchRequests, AttributeRulesWithOperators) {
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path tools = addApp(
      {"Tools",
       {{"L3",
         "com.test.l3",
         "1.0",
         kPoint,
         {{"Level", Value("3")},
          {"Kinds", Value(Array{Value("public.image"), Value("public.movie")})},
          {"Flagged", Value(true)},
          {"Count", Value(5)},
          {"ContentType", Value("public.image")}},
         {},
         {{"TopOnly", Value("here")}}},
        {"L9",
         "com.test.l9",
         "1.0",
         kPoint,
         {{"Level", Value("9")}, {"ContentType", Value("public.text")}},
         {{"OutsideAttributes", Value("x")}},
         {},
         Dictionary{{"com.test.flag", Value(true)}}},
        {"L10",
         "com.test.l10",
         "1.0",
         kPoint,
         {{"Level", Value("10")}, {"Flagged", Value(false)}, {"ContentType", Value("public.jpeg")}},
         {},
         {},
         Dictionary{{"com.test.flag", Value(false)}}}}});
  const Names l3{"com.test.l3"}, l9{"com.test.l9"}, l10{"com.test.l10"};
  const Names l3l9{"com.test.l3", "com.test.l9"}, l9l10{"com.test.l9", "com.test.l10"};
  const Names all{"com.test.l3", "com.test.l9", "com.test.l10"};
  const std::vector<RuleCase> cases{
      {"plain equality", R"({"Level": "9"})", l9},
      {"= operator", R"({"Level": "=10"})", l10},
      {"operand keeps its space", R"({"Level": "= 3"})", {}},
      {">= is numeric, not textual", R"({"Level": ">=10"})", l10},
      {"> is numeric", R"({"Level": ">3"})", l9l10},
      {"< is numeric", R"({"Level": "<10"})", l3l9},
      {"<= is less or equal", R"({"Level": "<=9"})", l3l9},
      {"<> is not equal", R"({"Level": "<>3"})", l9l10},
      {"array pattern: any element", R"({"Level": ["3", "10"]})", {"com.test.l3", "com.test.l10"}},
      {"empty array pattern", R"({"Level": []})", {}},
      {"array value: any element", R"({"Kinds": "public.movie"})", l3},
      {"pattern true", R"({"Flagged": true})", l3},
      {"pattern false: false or missing", R"({"Flagged": false})", l9l10},
      {"number attribute against string", R"({"Count": "5"})", {}},
      {"top-level info key", R"({"TopOnly": "here"})", l3},
      {"ZuExtension key outside the attributes", R"({"OutsideAttributes": "x"})", {}},
      {"type conformance",
       R"({"ContentType": "?TY-CONFORMS:public.image"})",
       {"com.test.l3", "com.test.l10"}},
      {"narrower type conformance", R"({"ContentType": "?TY-CONFORMS:public.jpeg"})", l10},
      {"type ancestry",
       R"({"ContentType": "?TY-IS:public.jpeg"})",
       {"com.test.l3", "com.test.l10"}},
      {"type ancestry of a supertype", R"({"ContentType": "?TY-IS:public.image"})", l3},
      {"identifier", R"({"ZuExtensionIdentifier": "com.test.l9"})", l9},
      {"entitlement", R"({"ENTITLEMENT:com.test.flag": true})", l9},
      {"containing application", R"({"ZuExtensionContainingApp": true})", all},
      {"missing attribute with string pattern", R"({"Nowhere": "x"})", {}},
      {"two rules", R"({"Level": ">3", "Flagged": false})", l9l10},
      {"two rules, one failing", R"({"Level": ">3", "Flagged": true})", {}},
  };
  for (const RuleCase& rule : cases) {
    Value extra = json(rule.rules);
    ASSERT_NE(extra.dictionary(), nullptr) << rule.name;
    Dictionary rules = pointRules();
    for (const auto& [key, pattern] : *extra.dictionary()) rules.insert_or_assign(key, pattern);
    EXPECT_EQ(identifiersOf(match(rules)), rule.expected) << rule.name << ": " << rule.rules;
  }
  // The containing application's path, and the plug-in's UUID.
  EXPECT_EQ(identifiersOf(match(Dictionary{{"ZuExtensionPointIdentifier", Value(kPoint)},
                                           {"ZuExtensionContainingApp", Value(tools.string())},
                                           {"Level", Value("3")}})),
            l3);
  std::string l10Uuid = uuidOf(tools / "PlugIns/L10.appex");
  EXPECT_EQ(identifiersOf(match(Dictionary{{"com.corvane.uuid", Value(l10Uuid)}})), l10);
}

TEST_F(MatchRequests, ContainingApplicationRuleFailsForASystemPlugIn) {
  systemPlugIn({"Sys", "com.test.sys"});
  ASSERT_NO_FATAL_FAILURE(start());
  addApp({"Tools", {{"A", "com.test.a"}}});
  Dictionary rules = pointRules();
  rules.insert_or_assign("ZuExtensionContainingApp", Value(false));
  EXPECT_EQ(identifiersOf(match(rules)), Names{});
  rules.insert_or_assign("ZuExtensionContainingApp", Value(true));
  EXPECT_EQ(identifiersOf(match(rules)), Names{"com.test.a"});
}

TEST_F(MatchRequests, UnrecognizedOperatorMatchesNothingAndIsLogged) {
  ASSERT_NO_FATAL_FAILURE(start());
  addApp({"Tools", {{"A", "com.test.a", "1.0", kPoint, {{"Level", Value("?BOGUS")}}}}});
  Dictionary rules = pointRules();
  rules.insert_or_assign("Level", Value("?BOGUS"));
  EXPECT_EQ(identifiersOf(match(rules)), Names{});
  EXPECT_FALSE(logLines({"unrecognized match operator:?BOGUS"}).empty()) << daemon_.log();
}

// ---- Elections ----------------------------------------------------------------------------------

TEST_F(MatchRequests, ElectionRuleFollowsTheStoredElection) {
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path tools = addApp({"Tools", {{"A", "com.test.a"}, {"B", "com.test.b"}}});
  std::string a = uuidOf(tools / "PlugIns/A.appex");
  auto elected = [&](const Value& election) {
    Dictionary rules = pointRules();
    rules.insert_or_assign("ZuUserElection", election);
    return identifiersOf(match(rules));
  };
  EXPECT_EQ(elected(Value("1")), Names{});
  EXPECT_EQ(elected(Value("0")), (Names{"com.test.a", "com.test.b"}));

  auto annotated = daemon_.ekctl({"annotate", "--set", R"({"election":1})", a});
  ASSERT_EQ(annotated.status, 0) << annotated.err << daemon_.log();

  EXPECT_EQ(elected(Value("1")), Names{"com.test.a"});
  EXPECT_EQ(elected(Value("=1")), Names{"com.test.a"});
  EXPECT_EQ(elected(Value("0")), Names{"com.test.b"});
  EXPECT_EQ(elected(Value(Array{Value("0"), Value("1")})), (Names{"com.test.a", "com.test.b"}));

  // Without an election rule both come back, each carrying its stored annotations.
  Value reply = matchPoint();
  EXPECT_EQ(identifiersOf(reply), (Names{"com.test.a", "com.test.b"}));
  Dictionary formA = formFor(reply, "com.test.a");
  EXPECT_EQ(formA["annotations"], Value(Dictionary{{"election", Value(1)}}));
  Dictionary formB = formFor(reply, "com.test.b");
  EXPECT_EQ(formB["annotations"], Value(Dictionary{}));
}

TEST_F(MatchRequests, ElectionBitsEightToFifteenAreIgnored) {
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path tools = addApp({"Tools", {{"A", "com.test.a"}, {"B", "com.test.b"}}});
  auto annotated = daemon_.ekctl(
      {"annotate", "--set", R"({"election":257})", uuidOf(tools / "PlugIns/A.appex")});
  ASSERT_EQ(annotated.status, 0) << annotated.err << daemon_.log();
  Dictionary rules = pointRules();
  rules.insert_or_assign("ZuUserElection", Value("1"));
  Value reply = match(rules);
  EXPECT_EQ(identifiersOf(reply), Names{"com.test.a"});
  EXPECT_EQ(formFor(reply, "com.test.a")["annotations"],
            Value(Dictionary{{"election", Value(257)}}));
}

// ---- De-duplication -----------------------------------------------------------------------------

TEST_F(MatchRequests, NewerVersionWinsByNumericComparison) {
  ASSERT_NO_FATAL_FAILURE(start());
  addApp({"Old", {{"D", "com.test.dup", "1.2"}}});
  fs::path newer = addApp({"New", {{"D", "com.test.dup", "1.10"}}});
  for (uint64_t flags : {uint64_t{0}, kKeepDuplicates}) {
    Value reply = matchPoint(flags);
    Dictionary form = formFor(reply, "com.test.dup");
    EXPECT_EQ(stringAt(form, "version"), "1.10") << "flags " << flags;
    EXPECT_EQ(stringAt(form, "path"), (newer / "PlugIns/D.appex").string()) << "flags " << flags;
  }
}

TEST_F(MatchRequests, KeepVersionsReturnsEveryVersion) {
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path old = addApp({"Old", {{"D", "com.test.dup", "1.2"}}});
  fs::path newer = addApp({"New", {{"D", "com.test.dup", "1.10"}}});
  Names both{(old / "PlugIns/D.appex").string(), (newer / "PlugIns/D.appex").string()};
  EXPECT_EQ(pathsOf(matchPoint(kKeepVersions)), both);
  EXPECT_EQ(pathsOf(matchPoint(kKeepVersions | kKeepDuplicates)), both);
}

TEST_F(MatchRequests, SameVersionIsReturnedOnceUnlessDuplicatesAreKept) {
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path first = addApp({"First", {{"D", "com.test.dup", "2.0"}}});
  fs::path second = addApp({"Second", {{"D", "com.test.dup", "2.0"}}});
  EXPECT_EQ(identifiersOf(matchPoint()), Names{"com.test.dup"});
  EXPECT_EQ(identifiersOf(matchPoint(kKeepVersions)), Names{"com.test.dup"});
  EXPECT_EQ(identifiersOf(matchPoint(kKeepDuplicates)), Names{"com.test.dup"});
  EXPECT_EQ(pathsOf(matchPoint(kKeepVersions | kKeepDuplicates)),
            (Names{(first / "PlugIns/D.appex").string(), (second / "PlugIns/D.appex").string()}));
}

TEST_F(MatchRequests, SameVersionInTwoApplicationsTheMoreRecentlyRegisteredWins) {
  ASSERT_NO_FATAL_FAILURE(start());
  addApp({"First", {{"D", "com.test.dup", "2.0"}}});
  // Registration times are whole seconds.
  std::this_thread::sleep_for(std::chrono::milliseconds(1100));
  fs::path second = addApp({"Second", {{"D", "com.test.dup", "2.0"}}});
  for (uint64_t flags : {uint64_t{0}, kKeepVersions}) {
    EXPECT_EQ(pathsOf(matchPoint(flags)), Names{(second / "PlugIns/D.appex").string()})
        << "flags " << flags;
  }
}

TEST_F(MatchRequests, SystemCopyBeatsTheApplicationCopyOfTheSameVersion) {
  fs::path system = systemPlugIn({"D", "com.test.dup", "2.0"});
  ASSERT_NO_FATAL_FAILURE(start());
  // Registered later, so the application copy would win on time alone.
  std::this_thread::sleep_for(std::chrono::milliseconds(1100));
  fs::path app = addApp({"Tools", {{"D", "com.test.dup", "2.0"}}});
  for (uint64_t flags : {uint64_t{0}, kKeepVersions}) {
    Value reply = matchPoint(flags);
    Dictionary form = formFor(reply, "com.test.dup");
    EXPECT_EQ(stringAt(form, "path"), system.string()) << "flags " << flags;
    EXPECT_EQ(form["systemResident"], Value(true)) << "flags " << flags;
  }
  EXPECT_EQ(pathsOf(matchPoint(kKeepVersions | kKeepDuplicates)),
            (Names{system.string(), (app / "PlugIns/D.appex").string()}));
}

TEST_F(MatchRequests, NewerApplicationCopyBeatsAnOlderSystemCopy) {
  systemPlugIn({"D", "com.test.dup", "2.0"});
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path app = addApp({"Tools", {{"D", "com.test.dup", "2.1"}}});
  Dictionary form = formFor(matchPoint(), "com.test.dup");
  EXPECT_EQ(stringAt(form, "path"), (app / "PlugIns/D.appex").string());
  EXPECT_EQ(form["systemResident"], Value(false));
}

// ---- Location and dedicated plug-ins ------------------------------------------------------------

TEST_F(MatchRequests, SystemOnlyFlagReturnsOnlySystemPlugIns) {
  fs::path system = systemPlugIn({"Sys", "com.test.sys"});
  ASSERT_NO_FATAL_FAILURE(start());
  addApp({"Tools", {{"A", "com.test.a"}}});
  EXPECT_EQ(identifiersOf(matchPoint()), (Names{"com.test.sys", "com.test.a"}));
  Value reply = matchPoint(kSystemOnly);
  EXPECT_EQ(pathsOf(reply), Names{system.string()});
  for (const Dictionary& form : formsOf(reply)) {
    auto resident = form.find("systemResident");
    ASSERT_NE(resident, form.end());
    EXPECT_EQ(resident->second, Value(true));
  }
}

TEST_F(MatchRequests, DedicatedPlugInIsOnlyForTheHostThatContainsIt) {
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path host =
      addApp({"Host",
              {{"Mine", "com.test.dedicated", "1.0", kPoint, {}, {{"Dedicated", Value(true)}}},
               {"Open", "com.test.open"}},
              true});
  fs::path other = addApp({"Other", {{"Own", "com.test.own"}}, true});
  EXPECT_EQ(identifiersOf(matchAs((host / "Host").string(), pointRules())),
            (Names{"com.test.dedicated", "com.test.open", "com.test.own"}));
  EXPECT_EQ(identifiersOf(matchAs((other / "Other").string(), pointRules())),
            (Names{"com.test.open", "com.test.own"}));
  // Clients without a bundle see no dedicated plug-ins.
  EXPECT_EQ(identifiersOf(matchPoint()), (Names{"com.test.open", "com.test.own"}));
  EXPECT_EQ(identifiersOf(matchAs(ekctlPath(), pointRules())),
            (Names{"com.test.open", "com.test.own"}));
}

TEST_F(MatchRequests, HostSeesItsOwnCopyOfAPlugInAndTheOtherCopyIsLogged) {
  daemon_.setEnvironment("EKORA_LOG", "ops:info");
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path host = addApp({"Host", {{"Shared", "com.test.shared", "1.0"}}, true});
  // Newer, so it is the copy every other client gets.
  fs::path other = addApp({"Other", {{"Shared", "com.test.shared", "2.0"}}});
  std::string hostCopy = (host / "PlugIns/Shared.appex").string();
  std::string otherCopy = (other / "PlugIns/Shared.appex").string();

  size_t before = daemon_.log().size();
  EXPECT_EQ(pathsOf(matchAs((host / "Host").string(), pointRules())), Names{hostCopy});
  EXPECT_EQ(logLines({"Ignoring " + uuidOf(otherCopy) + " @ '" + otherCopy +
                      "' in favor of bundle-relative '" + hostCopy + "'"},
                     before)
                .size(),
            1u)
      << logSince(before);

  before = daemon_.log().size();
  EXPECT_EQ(pathsOf(matchAs(ekctlPath(), pointRules())), Names{otherCopy});
  EXPECT_TRUE(logLines({"in favor of bundle-relative"}, before).empty()) << logSince(before);
}

TEST_F(MatchRequests, BundleRelativePreferenceIsAPlainCharacterPrefix) {
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path pre = addApp({"Pre", {{"Shared", "com.test.shared", "1.0"}}});
  fs::path other = addApp({"Other", {{"Shared", "com.test.shared", "2.0"}}});
  // ".../Pre.app" is a character prefix of ".../Pre.appendix/ekctl".
  std::string client = ekctlCopy(apps_ / "Pre.appendix", Dictionary{});
  EXPECT_EQ(pathsOf(matchAs(client, pointRules())), Names{(pre / "PlugIns/Shared.appex").string()});
  std::string elsewhere = ekctlCopy(root_ / "elsewhere", Dictionary{});
  EXPECT_EQ(pathsOf(matchAs(elsewhere, pointRules())),
            Names{(other / "PlugIns/Shared.appex").string()});
}

// ---- Privileged discovery -----------------------------------------------------------------------

TEST_F(MatchRequests, DiscoverAllWithoutTheManagerEntitlementIsUnauthorized) {
  ASSERT_NO_FATAL_FAILURE(start());
  addApp({"Tools", {{"A", "com.test.a"}}});
  expectFailure(matchPoint(kDiscoverAll), 11, "unauthorized discovery flag (EkDiscoverAll)");
  expectFailure(matchPoint(kDiscoverAll | kKeepVersions), 11,
                "unauthorized discovery flag (EkDiscoverAll)");
  auto result =
      daemon_.ekctl({"match", "--flags", "512",
                     R"({"ZuExtensionPointIdentifier":")" + std::string(kPoint) + R"("})"});
  EXPECT_EQ(result.status, 1);
  EXPECT_NE(result.err.find("ekctl: error 11: unauthorized discovery flag (EkDiscoverAll)"),
            std::string::npos)
      << result.err;
}

class PrivilegedDiscovery : public MatchRequests {
 protected:
  void SetUp() override {
    MatchRequests::SetUp();
    systemPlugIn({"Sys", "com.test.sys"});
    ASSERT_NO_FATAL_FAILURE(start());
    addApp({"Host",
            {{"Mine", "com.test.dedicated", "1.0", kPoint, {}, {{"Dedicated", Value(true)}}}}});
    addApp({"Tools",
            {{"A", "com.test.a"},
             {"Guarded",
              "com.test.guarded",
              "1.0",
              kPoint,
              {},
              {{"ZuExtensionHostEntitlement", Value("com.test.may-host")}}}}});
    manager_ = ekctlCopy(root_ / "manager", {{kManager, Value(true)}});
  }
  std::string manager_;
};

TEST_F(PrivilegedDiscovery, ManagerSeesPlugInsOtherwiseFilteredOut) {
  const Names visible{"com.test.sys", "com.test.a"};
  const Names everything{"com.test.sys", "com.test.a", "com.test.dedicated", "com.test.guarded"};
  EXPECT_EQ(identifiersOf(matchAs(manager_, pointRules())), visible);
  EXPECT_EQ(identifiersOf(matchAs(manager_, pointRules(), kDiscoverAll)), everything);
  // The location filters, the system-only one among them, are skipped too.
  EXPECT_EQ(identifiersOf(matchAs(manager_, pointRules(), kDiscoverAll | kSystemOnly)), everything);
  EXPECT_EQ(identifiersOf(matchAs(manager_, pointRules(), kSystemOnly)), Names{"com.test.sys"});
}

TEST_F(PrivilegedDiscovery, HostRestrictionDoesNotApplyToDiscoverAll) {
  std::string restricted = ekctlCopy(
      root_ / "restricted-manager",
      {{kManager, Value(true)},
       {kAllowedPlugIns, Value(Dictionary{{"ZuExtensionIdentifier", Value("com.test.a")}})}});
  EXPECT_EQ(identifiersOf(matchAs(restricted, pointRules())), Names{"com.test.a"});
  EXPECT_EQ(identifiersOf(matchAs(restricted, pointRules(), kDiscoverAll)),
            (Names{"com.test.sys", "com.test.a", "com.test.dedicated", "com.test.guarded"}));
}

TEST_F(PrivilegedDiscovery, SandboxedManagerIsUnauthorized) {
  // The sandboxed manager may discover as usual...
  EXPECT_EQ(identifiersOf(matchSandboxed(manager_, pointRules(), 0)),
            (Names{"com.test.sys", "com.test.a"}));
  // ...but not with the privileged flag.
  expectFailure(matchSandboxed(manager_, pointRules(), kDiscoverAll), 11,
                "unauthorized discovery flag (EkDiscoverAll)");
}

// ---- Host permission ----------------------------------------------------------------------------

TEST_F(MatchRequests, HostRestrictionEntitlementLimitsTheResults) {
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path tools = addApp({"Tools", {{"A", "com.test.a"}, {"B", "com.test.b"}}});
  std::string b = uuidOf(tools / "PlugIns/B.appex");

  std::string onlyA = ekctlCopy(
      root_ / "only-a",
      {{kAllowedPlugIns, Value(Dictionary{{"ZuExtensionIdentifier", Value("com.test.a")}})}});
  size_t before = daemon_.log().size();
  EXPECT_EQ(identifiersOf(matchAs(onlyA, pointRules())), Names{"com.test.a"});
  EXPECT_EQ(logLines({"cannot use plugin " + b +
                      ": the host's plug-in entitlement does not allow this plug-in"},
                     before)
                .size(),
            1u)
      << logSince(before);

  std::string both =
      ekctlCopy(root_ / "both",
                {{kAllowedPlugIns,
                  Value(Dictionary{{"ZuExtensionIdentifier",
                                    Value(Array{Value("com.test.a"), Value("com.test.b")})}})}});
  EXPECT_EQ(identifiersOf(matchAs(both, pointRules())), (Names{"com.test.a", "com.test.b"}));

  std::string empty = ekctlCopy(root_ / "empty", {{kAllowedPlugIns, Value(Dictionary{})}});
  EXPECT_EQ(identifiersOf(matchAs(empty, pointRules())), (Names{"com.test.a", "com.test.b"}));
}

TEST_F(MatchRequests, InvalidHostRestrictionEntitlementAllowsNothing) {
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path tools = addApp({"Tools", {{"A", "com.test.a"}}});
  std::string invalid = ekctlCopy(root_ / "invalid", {{kAllowedPlugIns, Value("com.test.a")}});
  size_t before = daemon_.log().size();
  EXPECT_EQ(identifiersOf(matchAs(invalid, pointRules())), Names{});
  EXPECT_EQ(logLines({"cannot use plugin " + uuidOf(tools / "PlugIns/A.appex") +
                      ": invalid host restriction entitlement"},
                     before)
                .size(),
            1u)
      << logSince(before);
}

TEST_F(MatchRequests, PlugInRequiringAHostEntitlementIsShownOnlyToHostsHoldingIt) {
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path tools = addApp({"Tools",
                           {{"A", "com.test.a"},
                            {"Guarded",
                             "com.test.guarded",
                             "1.0",
                             kPoint,
                             {},
                             {{"ZuExtensionHostEntitlement", Value("com.test.may-host")}}}}});
  std::string guarded = uuidOf(tools / "PlugIns/Guarded.appex");

  size_t before = daemon_.log().size();
  EXPECT_EQ(identifiersOf(matchPoint()), Names{"com.test.a"});
  EXPECT_EQ(logLines({"client " + std::to_string(getpid()) + " cannot use plugin " + guarded +
                      ": the host does not have the \"com.test.may-host\" entitlement"},
                     before)
                .size(),
            1u)
      << logSince(before);

  std::string holder = ekctlCopy(root_ / "holder", {{"com.test.may-host", Value(true)}});
  EXPECT_EQ(identifiersOf(matchAs(holder, pointRules())),
            (Names{"com.test.a", "com.test.guarded"}));
  std::string named = ekctlCopy(root_ / "named", {{"com.test.may-host", Value("yes")}});
  EXPECT_EQ(identifiersOf(matchAs(named, pointRules())), (Names{"com.test.a", "com.test.guarded"}));
  std::string refused = ekctlCopy(root_ / "refused", {{"com.test.may-host", Value(false)}});
  EXPECT_EQ(identifiersOf(matchAs(refused, pointRules())), Names{"com.test.a"});
}

// ---- Global exclusions --------------------------------------------------------------------------

TEST_F(MatchRequests, GlobalExclusionWrittenWithEkctlDefaultsRemovesThePlugInForEveryone) {
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path tools = addApp({"Tools", {{"A", "com.test.a"}, {"B", "com.test.b"}}});
  std::string a = uuidOf(tools / "PlugIns/A.appex");
  std::string manager = ekctlCopy(root_ / "manager", {{kManager, Value(true)}});
  EXPECT_EQ(identifiersOf(matchPoint()), (Names{"com.test.a", "com.test.b"}));

  auto written = daemon_.ekctl({"defaults", "write", kPrefsDomain, "exclusions",
                                R"([{"ZuExtensionIdentifier":"com.test.a"}])"});
  ASSERT_EQ(written.status, 0) << written.err;
  EXPECT_TRUE(fs::exists(root_ / "state/preferences" / std::to_string(getuid()) /
                         (std::string(kPrefsDomain) + ".dmap")));

  size_t before = daemon_.log().size();
  EXPECT_EQ(identifiersOf(matchPoint()), Names{"com.test.b"});
  EXPECT_EQ(logLines({"client " + std::to_string(getpid()) + " plugin " + a + " globally excluded"},
                     before)
                .size(),
            1u)
      << logSince(before);
  EXPECT_EQ(identifiersOf(matchAs(manager, pointRules(), kDiscoverAll)), Names{"com.test.b"});

  auto deleted = daemon_.ekctl({"defaults", "delete", kPrefsDomain, "exclusions"});
  ASSERT_EQ(deleted.status, 0) << deleted.err;
  EXPECT_EQ(identifiersOf(matchPoint()), (Names{"com.test.a", "com.test.b"}));
  EXPECT_EQ(identifiersOf(matchAs(manager, pointRules(), kDiscoverAll)),
            (Names{"com.test.a", "com.test.b"}));
}

TEST_F(MatchRequests, ExclusionsChangedByAnotherProcessAreHonouredAtTheNextRequest) {
  ASSERT_NO_FATAL_FAILURE(start());
  addApp({"Tools",
          {{"A", "com.test.a", "1.0", kPoint, {{"Level", Value("10")}}},
           {"B", "com.test.b", "1.0", kPoint, {{"Level", Value("2")}}}}});
  fs::path prefs = root_ / "state/preferences" / std::to_string(getuid());
  fs::create_directories(prefs);
  fs::path file = prefs / (std::string(kPrefsDomain) + ".dmap");

  writeDmap(file, {{"exclusions", Value(Array{Value(Dictionary{{"Level", Value(">=5")}})})}});
  EXPECT_EQ(identifiersOf(matchPoint()), Names{"com.test.b"});
  writeDmap(file, {{"exclusions", Value(Array{Value(Dictionary{{"Level", Value("<5")}}),
                                              Value(Dictionary{{"Level", Value("7")}})})}});
  EXPECT_EQ(identifiersOf(matchPoint()), Names{"com.test.a"});
  writeDmap(file, {{"other", Value(true)}});
  EXPECT_EQ(identifiersOf(matchPoint()), (Names{"com.test.a", "com.test.b"}));
}

// ---- Replacement --------------------------------------------------------------------------------

TEST_F(MatchRequests, ReplacingPlugInNamedByAStringMarksBothForms) {
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path tools = addApp(
      {"Tools",
       {{"A", "com.test.a"},
        {"B", "com.test.b", "1.0", kPoint, {}, {}, {}, Dictionary{{kReplace, Value("com.test.a")}}},
        {"C", "com.test.c"}}});
  std::string a = uuidOf(tools / "PlugIns/A.appex");
  std::string b = uuidOf(tools / "PlugIns/B.appex");

  size_t before = daemon_.log().size();
  Value reply = matchPoint();
  EXPECT_EQ(identifiersOf(reply), (Names{"com.test.a", "com.test.b", "com.test.c"}));
  Dictionary formA = formFor(reply, "com.test.a");
  Dictionary formB = formFor(reply, "com.test.b");
  Dictionary formC = formFor(reply, "com.test.c");
  EXPECT_EQ(stringAt(formA, "overrider"), b);
  EXPECT_EQ(formA.count("overriding"), 0u);
  EXPECT_EQ(stringAt(formB, "overriding"), "com.test.a");
  EXPECT_EQ(formB.count("overrider"), 0u);
  EXPECT_EQ(formC.count("overrider"), 0u);
  EXPECT_EQ(formC.count("overriding"), 0u);
  EXPECT_EQ(logLines({"plug-in " + b + " overrides " + a}, before).size(), 1u) << logSince(before);
}

TEST_F(MatchRequests, ReplacingPlugInNamedByAnArrayMarksEveryNamedForm) {
  ASSERT_NO_FATAL_FAILURE(start());
  Array replaced{Value("com.test.a"), Value(7), Value("com.test.b"), Value("com.test.missing")};
  fs::path tools = addApp(
      {"Tools",
       {{"A", "com.test.a"},
        {"B", "com.test.b"},
        {"C", "com.test.c", "1.0", kPoint, {}, {}, {}, Dictionary{{kReplace, Value(replaced)}}},
        {"D", "com.test.d"}}});
  std::string c = uuidOf(tools / "PlugIns/C.appex");
  Value reply = matchPoint();
  EXPECT_EQ(identifiersOf(reply), (Names{"com.test.a", "com.test.b", "com.test.c", "com.test.d"}));
  EXPECT_EQ(stringAt(formFor(reply, "com.test.a"), "overrider"), c);
  EXPECT_EQ(stringAt(formFor(reply, "com.test.b"), "overrider"), c);
  Dictionary formC = formFor(reply, "com.test.c");
  EXPECT_EQ(formC.count("overrider"), 0u);
  // One "overriding" entry: the identifier of whichever replaced form came last.
  std::string overriding = stringAt(formC, "overriding");
  EXPECT_TRUE(overriding == "com.test.a" || overriding == "com.test.b") << overriding;
  Dictionary formD = formFor(reply, "com.test.d");
  EXPECT_EQ(formD.count("overrider"), 0u);
  EXPECT_EQ(formD.count("overriding"), 0u);
}

TEST_F(MatchRequests, ReplacingPlugInThatIsNotReturnedMarksNothing) {
  ASSERT_NO_FATAL_FAILURE(start());
  addApp({"Tools",
          {{"A", "com.test.a"},
           {"B",
            "com.test.b",
            "1.0",
            kPoint,
            {},
            {},
            {},
            Dictionary{{kReplace, Value("com.test.a")}}}}});
  Dictionary rules = pointRules();
  rules.insert_or_assign("ZuExtensionIdentifier", Value("com.test.a"));
  Value reply = match(rules);
  Dictionary formA = formFor(reply, "com.test.a");
  EXPECT_EQ(formA.count("overrider"), 0u) << reply.description();
}

// ---- Reply ------------------------------------------------------------------------------------

TEST_F(MatchRequests, VersionTwoRequestSucceedsWithoutMatches) {
  ASSERT_NO_FATAL_FAILURE(start());
  addApp({"Tools", {{"A", "com.test.a"}}});
  Value reply = ask(Value(Dictionary{
      {"request", Value("match")}, {"version", Value(2)}, {"rules", Value(pointRules())}}));
  EXPECT_EQ(replyErrorCode(reply), 0) << reply.description();
  EXPECT_EQ(reply.get("error"), nullptr) << reply.description();
  EXPECT_EQ(reply.get("matches"), nullptr) << reply.description();
}

TEST_F(MatchRequests, EveryFormCarriesAnnotationsAndTheDaemonsAdditions) {
  fs::path system = systemPlugIn({"Sys", "com.test.sys"});
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path tools = addApp({"Tools", {{"A", "com.test.a", "3.4"}, {"B", "com.test.b"}}});
  auto annotated =
      daemon_.ekctl({"annotate", "--set", R"({"election":1})", uuidOf(tools / "PlugIns/B.appex")});
  ASSERT_EQ(annotated.status, 0) << annotated.err;

  Value reply = match(std::nullopt);
  std::vector<Dictionary> forms = formsOf(reply);
  ASSERT_EQ(forms.size(), 3u) << reply.description();
  for (const Dictionary& form : forms) {
    std::string identifier = stringAt(form, "identifier");
    auto annotations = form.find("annotations");
    ASSERT_NE(annotations, form.end()) << identifier;
    ASSERT_NE(annotations->second.dictionary(), nullptr) << identifier;
    EXPECT_EQ(annotations->second.dictionary()->empty(), identifier != "com.test.b") << identifier;
    auto extensions = form.find("extensions");
    ASSERT_NE(extensions, form.end()) << identifier;
    ASSERT_NE(extensions->second.dictionary(), nullptr) << identifier;
    EXPECT_EQ(extensions->second.dictionary()->count("."), 1u) << identifier;
    EXPECT_NE(stringAt(form, "service-extension"), "<absent>") << identifier;
    EXPECT_TRUE(Uuid::parse(stringAt(form, "uuid"))) << identifier;
  }
  Dictionary a = formFor(reply, "com.test.a");
  EXPECT_EQ(stringAt(a, "version"), "3.4");
  EXPECT_EQ(stringAt(a, "path"), (tools / "PlugIns/A.appex").string());
  EXPECT_EQ(stringAt(a, "containingPath"), tools.string());
  EXPECT_EQ(a["systemResident"], Value(false));
  Dictionary sys = formFor(reply, "com.test.sys");
  EXPECT_EQ(stringAt(sys, "path"), system.string());
  EXPECT_EQ(sys.count("containingPath"), 0u);
  EXPECT_EQ(sys["systemResident"], Value(true));
}

TEST_F(MatchRequests, CountsAreLoggedOnlyWhenInfoLoggingIsEnabled) {
  daemon_.setEnvironment("EKORA_LOG", "ops:info");
  ASSERT_NO_FATAL_FAILURE(start());
  fs::path tools = addApp({"Tools", {{"A", "com.test.a", "1.5"}}});
  std::string a = uuidOf(tools / "PlugIns/A.appex");

  size_t before = daemon_.log().size();
  EXPECT_EQ(identifiersOf(match(pointRules("com.test.match.nobody"))), Names{});
  EXPECT_EQ(logLines({"Candidate plugin count: 0"}, before).size(), 1u) << logSince(before);
  EXPECT_EQ(logLines({"Resulting plugin count: 0"}, before).size(), 1u) << logSince(before);

  before = daemon_.log().size();
  EXPECT_EQ(identifiersOf(matchPoint()), Names{"com.test.a"});
  EXPECT_EQ(logLines({"Candidate plugin count: 1, info: ", "com.test.a(1.5) " + a}, before).size(),
            1u)
      << logSince(before);
  EXPECT_EQ(logLines({"Resulting plugin count: 1, UUIDs: ", a}, before).size(), 1u)
      << logSince(before);

  ASSERT_EQ(daemon_.terminate(), 0);
  daemon_.setEnvironment("EKORA_LOG", "default");
  ASSERT_NO_FATAL_FAILURE(start());
  before = daemon_.log().size();
  EXPECT_EQ(identifiersOf(matchPoint()), Names{"com.test.a"});
  EXPECT_TRUE(logLines({"plugin count"}, before).empty()) << logSince(before);
}

}  // namespace
}  // namespace ek::test
