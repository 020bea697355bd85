// Attribute matching and host permission of the daemon's plug-in record.
#include <cmath>
#include <compare>
#include <cstdint>
#include <limits>
#include <optional>
#include <unordered_set>

#include "Ekora/EkCollections.h"
#include "Ekora/EkProtocol.h"
#include "ekd/EkDPlugIn.h"
#include "ekd/EkDWyreClient.h"
#include "platform/log/Log.h"
#include "platform/types/TypeSystem.h"

namespace ek {

namespace {

constexpr std::string_view kEntitlementKeyPrefix = "ENTITLEMENT:";
constexpr std::string_view kKeyIdentifier = "ZuExtensionIdentifier";
constexpr std::string_view kKeyUuid = "com.corvane.uuid";
constexpr std::string_view kKeyElection = "ZuUserElection";
constexpr std::string_view kKeyContainingApp = "ZuExtensionContainingApp";
constexpr std::string_view kAnnotationElection = "election";
// Bits 8 to 15 of a stored election are not part of the choice the user made.
constexpr int64_t kElectionFlagBits = 0xFF00;

constexpr std::string_view kTypeConforms = "?TY-CONFORMS:";
constexpr std::string_view kTypeIs = "?TY-IS:";

constexpr std::string_view kLogUnrecognizedOperator = "unrecognized match operator:%@";
constexpr std::string_view kLogEvaluatingFilter = "evaluating ZuExtension filter: %@ value: %@";

constexpr std::string_view kInvalidRestriction = "invalid host restriction entitlement";
constexpr std::string_view kRestrictionRefuses =
    "the host's plug-in entitlement does not allow this plug-in";
constexpr std::string_view kMissingHostEntitlement =
    "the host does not have the \"%@\" entitlement";

enum class Comparison { NotEqual, NotGreater, NotLess, Equal, Less, Greater };

struct Operator {
  std::string_view prefix;
  Comparison comparison;
};

// Two-character operators come first, so "<=5" is "not greater than 5", not "less than =5".
constexpr Operator kOperators[] = {
    {"<>", Comparison::NotEqual}, {"<=", Comparison::NotGreater}, {">=", Comparison::NotLess},
    {"=", Comparison::Equal},     {"<", Comparison::Less},        {">", Comparison::Greater},
};

// Splits a pattern into its comparison and operand; the operand keeps any spaces.
std::pair<Comparison, std::string_view> parseOperator(std::string_view pattern) {
  for (const Operator& op : kOperators) {
    if (pattern.starts_with(op.prefix)) {
      return {op.comparison, pattern.substr(op.prefix.size())};
    }
  }
  return {Comparison::Equal, pattern};
}

bool accepts(Comparison comparison, std::strong_ordering order) {
  switch (comparison) {
    case Comparison::NotEqual:
      return order != 0;
    case Comparison::NotGreater:
      return order <= 0;
    case Comparison::NotLess:
      return order >= 0;
    case Comparison::Equal:
      return order == 0;
    case Comparison::Less:
      return order < 0;
    case Comparison::Greater:
      return order > 0;
  }
  return false;
}

// The numeric string ordering: case-sensitive, digit runs by value, linear in the shorter
// string, and equal only for identical strings. That makes it a total order, which the
// array summary below relies on.
std::strong_ordering compareNumeric(std::string_view value, std::string_view operand) {
  return compareVersionString(value, operand);
}

bool isFalse(const Value& value) {
  const bool* flag = value.boolean();
  return flag != nullptr && !*flag;
}

bool isTrue(const Value& value) {
  const bool* flag = value.boolean();
  return flag != nullptr && *flag;
}

// The string elements of an array value, summarised so that a pattern list can be tested
// against all of them at once. Because the numeric ordering is total and equal only for
// identical strings, "some element compares so with the operand" reduces to the set, its least
// and its greatest element: an array value against an array pattern costs the sum of their
// sizes, not their product.
class StringSet {
 public:
  explicit StringSet(const Array& elements) {
    for (const Value& element : elements) {
      const std::string* text = element.string();
      if (text == nullptr) continue;
      if (members_.empty()) {
        least_ = greatest_ = *text;
      } else {
        if (compareNumeric(*text, least_) < 0) least_ = *text;
        if (compareNumeric(*text, greatest_) > 0) greatest_ = *text;
      }
      members_.insert(*text);
    }
  }

  bool empty() const { return members_.empty(); }
  bool contains(std::string_view text) const { return members_.contains(text); }

  // Whether some member conforms to supertype: the members and all their ancestors are
  // gathered once, on the first type test.
  bool anyConforms(const types::TypeSystem& types, std::string_view supertype) {
    if (!ancestors_) {
      ancestors_.emplace();
      for (std::string_view member : members_) {
        types.forEachAncestor(member,
                              [&](std::string_view ancestor) { ancestors_->insert(ancestor); });
      }
    }
    return ancestors_->contains(supertype);
  }

  // Whether some member compares with operand as comparison asks.
  bool anyCompares(Comparison comparison, std::string_view operand) const {
    if (members_.empty()) return false;
    switch (comparison) {
      case Comparison::Equal:
        return members_.contains(operand);
      case Comparison::NotEqual:
        return members_.size() > 1 || !members_.contains(operand);
      case Comparison::Less:
      case Comparison::NotGreater:
        return accepts(comparison, compareNumeric(least_, operand));
      case Comparison::Greater:
      case Comparison::NotLess:
        return accepts(comparison, compareNumeric(greatest_, operand));
    }
    return false;
  }

 private:
  std::unordered_set<std::string_view> members_;
  std::optional<std::unordered_set<std::string_view>> ancestors_;
  std::string_view least_;
  std::string_view greatest_;
};

const types::TypeSystem& typeSystemOf(const EkDPlugInContext& context) {
  if (context.types) return *context.types;
  static const std::shared_ptr<types::TypeSystem> system = types::TypeSystem::system();
  return *system;
}

// What matchValue(element, pattern) answers for at least one element of the set, with each
// element looked at once at most.
bool matchAny(const types::TypeSystem& types, StringSet& values, std::string_view pattern) {
  if (pattern.starts_with('?')) {
    if (pattern.starts_with(kTypeConforms)) {
      return values.anyConforms(types, pattern.substr(kTypeConforms.size()));
    }
    if (pattern.starts_with(kTypeIs)) {
      // Some element is the operand or one of its ancestors.
      bool found = false;
      types.forEachAncestor(pattern.substr(kTypeIs.size()), [&](std::string_view ancestor) {
        found = found || values.contains(ancestor);
      });
      return found;
    }
    log::ops().info(kLogUnrecognizedOperator, pattern);
    return false;
  }
  auto [comparison, operand] = parseOperator(pattern);
  return values.anyCompares(comparison, operand);
}

}  // namespace

// ---- Matching --------------------------------------------------------------------------------

bool EkDPlugIn::match(const Dictionary* rules) const {
  if (rules == nullptr) return true;
  return match(rules, *currentInfo());
}

bool EkDPlugIn::match(const Dictionary* rules, const CurrentInfo& current) const {
  if (rules == nullptr) return true;
  for (const auto& [key, pattern] : *rules) {
    if (!matchKey(key, pattern, current)) return false;
  }
  return true;
}

bool EkDPlugIn::matchKey(std::string_view key, const Value& pattern) const {
  return matchKey(key, pattern, *currentInfo());
}

bool EkDPlugIn::matchKey(std::string_view key, const Value& pattern,
                         const CurrentInfo& current) const {
  // Values made for the special keys live here, the rest stay where they are.
  std::optional<Value> made;
  ValueRef entitlement;
  const Value* value = nullptr;
  if (key.starts_with(kEntitlementKeyPrefix)) {
    entitlement = valueForEntitlement(key.substr(kEntitlementKeyPrefix.size()));
    value = entitlement.get();
  } else {
    if (key == kKeyIdentifier) {
      if (std::optional<std::string> identifier = this->identifier()) {
        made.emplace(std::move(*identifier));
      }
    } else if (key == kKeyUuid) {
      made.emplace(uuid().string());
    } else if (key == kKeyElection) {
      int64_t election = 0;
      if (context_.annotations) {
        if (std::optional<Dictionary> annotation = context_.annotations(*this)) {
          auto it = annotation->find(kAnnotationElection);
          if (it != annotation->end()) election = electionNumber(it->second).value_or(0);
        }
      }
      made.emplace(std::to_string(election & ~kElectionFlagBits));
    } else if (key == kKeyContainingApp) {
      std::optional<std::string> containing = containingPath();
      if (!containing) return false;
      made.emplace(std::move(*containing));
    }
    if (made) value = &*made;
    if (!value) value = current.attribute(key);
    if (!value) value = infoValue(current, key);
  }

  if (isTrue(pattern)) return value && !isFalse(*value);
  if (isFalse(pattern)) return !value || isFalse(*value);
  if (!value) return false;
  if (const Dictionary* description = pattern.dictionary()) {
    return matchDictionary(*value, *description);
  }
  if (const std::string* text = value->string()) return matchValue(*text, pattern);
  if (const Array* elements = value->array()) {
    StringSet set(*elements);
    if (set.empty()) return false;
    const types::TypeSystem& types = typeSystemOf(context_);
    if (const std::string* single = pattern.string()) return matchAny(types, set, *single);
    if (const Array* list = pattern.array()) {
      for (const Value& element : *list) {
        const std::string* single = element.string();
        if (single != nullptr && matchAny(types, set, *single)) return true;
      }
    }
    return false;
  }
  return false;
}

bool EkDPlugIn::matchValue(std::string_view value, const Value& patterns) const {
  if (const std::string* pattern = patterns.string()) {
    return matchValue(value, std::string_view(*pattern));
  }
  if (const Array* list = patterns.array()) {
    for (const Value& element : *list) {
      const std::string* pattern = element.string();
      if (pattern != nullptr && matchValue(value, std::string_view(*pattern))) return true;
    }
  }
  return false;
}

bool EkDPlugIn::matchValue(std::string_view value, std::string_view pattern) const {
  if (pattern.starts_with('?')) {
    const types::TypeSystem& types = typeSystemOf(context_);
    if (pattern.starts_with(kTypeConforms)) {
      return types.conforms(value, pattern.substr(kTypeConforms.size()));
    }
    if (pattern.starts_with(kTypeIs)) {
      return types.conforms(pattern.substr(kTypeIs.size()), value);
    }
    log::ops().info(kLogUnrecognizedOperator, pattern);
    return false;
  }
  auto [comparison, operand] = parseOperator(pattern);
  return accepts(comparison, compareNumeric(value, operand));
}

bool EkDPlugIn::matchDictionary(const Value& value, const Dictionary& pattern) const {
  // The pattern is copied into a Value only when the line is written.
  if (log::extension().enabled(log::Level::Debug)) {
    log::extension().debug(kLogEvaluatingFilter, Value(pattern), value);
  }
  return typeSystemOf(context_).evaluateActivationRule(value, pattern);
}

// ---- Host permission -------------------------------------------------------------------------

std::optional<std::string> EkDPlugIn::allowForClient(const EkDClientProcess& client) const {
  return allowForClient(client, *currentInfo());
}

std::optional<std::string> EkDPlugIn::allowForClient(const EkDClientProcess& client,
                                                     const CurrentInfo& current) const {
  if (std::optional<Value> restriction =
          client.entitlementValueForKey(protocol::kEntitlementAllowedPlugIns)) {
    const Dictionary* rules = restriction->dictionary();
    if (rules == nullptr) return std::string(kInvalidRestriction);
    if (!match(rules, current)) return std::string(kRestrictionRefuses);
  }
  if (const Value* required = current.hostEntitlement) {
    // A name that is not a string is one no host can hold.
    if (const std::string* name = required->string()) {
      if (!client.hasEntitlement(*name)) return log::format(kMissingHostEntitlement, *name);
    } else {
      return log::format(kMissingHostEntitlement, required->description());
    }
  }
  return std::nullopt;
}

}  // namespace ek
