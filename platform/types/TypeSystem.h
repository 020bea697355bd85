#pragma once

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/value/Value.h"

// The uniform type system: type identifiers in a hierarchy (public.item -> public.data ->
// public.image -> public.jpeg, ...), compiled in and extended by
// $EKORA_SYSTEM_ROOT/Library/Types/*.dmap (each file: identifier -> array of parent
// identifiers), and the activation-rule evaluator built on it.
namespace ek::types {

class TypeSystem {
 public:
  // The compiled-in hierarchy only.
  TypeSystem();
  // The compiled-in hierarchy extended by every *.dmap file in directory. Files that cannot
  // be read or are not shaped as above are logged and skipped; entries that would form a
  // cycle are ignored. Bounded: at most 4096 files, 65536 declared types, 64 parents each.
  static std::shared_ptr<TypeSystem> loadFrom(const std::string& directory);
  // Loaded once from $EKORA_SYSTEM_ROOT/Library/Types.
  static std::shared_ptr<TypeSystem> system();

  // A type conforms to itself and to every ancestor. Unknown types conform only to themselves.
  bool conforms(std::string_view type, std::string_view supertype) const;
  // The parents declared for a type (empty when unknown or a root).
  std::vector<std::string> parents(std::string_view type) const;
  // Calls visit with type itself and then each of its ancestors, each once, nearest first.
  // Views of ancestors stay valid as long as this type system. Linear in the hierarchy.
  void forEachAncestor(std::string_view type,
                       const std::function<void(std::string_view)>& visit) const;

  // An activation rule: type identifier -> largest number of items of that type the plug-in
  // takes (an unsigned or negative integer or a double), or boolean true for any number. The
  // host's items: type identifier -> item count. The rule accepts when every host type (with
  // a count above 0) conforms to some rule type and, for each rule type, the number of host
  // items conforming to it stays within its limit. A rule or item description of any other
  // shape does not accept. Linear in (rule size x item types x hierarchy depth).
  bool evaluateActivationRule(const Value& rule, const Dictionary& items) const;

 private:
  void declare(const std::string& type, std::vector<std::string> parents);
  // Whether to is from or one of its ancestors: a breadth-first walk with a visited set, so
  // it ends on any graph. Each parent looked at costs one unit of budget; an exhausted budget
  // answers true (the caller then refuses what it was checking).
  bool reaches(std::string_view from, std::string_view to, size_t& budget) const;
  std::map<std::string, std::vector<std::string>, std::less<>> parents_;
};

}  // namespace ek::types
