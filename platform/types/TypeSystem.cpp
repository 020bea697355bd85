#include "platform/types/TypeSystem.h"

#include <dirent.h>

#include <algorithm>
#include <cmath>
#include <deque>
#include <limits>
#include <optional>
#include <unordered_set>
#include <utility>
#include <variant>

#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"
#include "platform/paths/Directories.h"

namespace ek::types {

namespace {

constexpr size_t kMaxFiles = 4096;
constexpr size_t kMaxDeclaredTypes = 65536;
constexpr size_t kMaxParents = 64;
// Each edge a file adds is checked for a cycle by walking the new parent's ancestors; the
// walks of one load share this budget, so no arrangement of files makes loading quadratic
// without bound. Far above what any real hierarchy needs.
constexpr size_t kMaxCycleCheckVisits = size_t{1} << 24;

constexpr std::string_view kFileSuffix = ".dmap";

struct BuiltIn {
  const char* type;
  std::initializer_list<const char*> parents;
};

// The hierarchy every system has, whatever its Types directory holds.
const BuiltIn kBuiltIn[] = {
    {"public.item", {}},
    {"public.content", {"public.item"}},
    {"public.composite-content", {"public.content"}},
    {"public.data", {"public.item"}},
    {"public.directory", {"public.item"}},
    {"public.folder", {"public.directory"}},
    {"public.volume", {"public.folder"}},
    {"public.package", {"public.directory"}},
    {"public.symlink", {"public.item"}},
    {"public.executable", {"public.item"}},
    {"public.contact", {"public.item"}},
    {"public.calendar-event", {"public.item"}},
    {"public.message", {"public.item"}},
    {"public.database", {"public.item"}},

    {"public.text", {"public.data", "public.content"}},
    {"public.plain-text", {"public.text"}},
    {"public.utf8-plain-text", {"public.plain-text"}},
    {"public.utf16-plain-text", {"public.plain-text"}},
    {"public.rtf", {"public.text"}},
    {"public.html", {"public.text"}},
    {"public.xml", {"public.text"}},
    {"public.json", {"public.text"}},
    {"public.source-code", {"public.plain-text"}},
    {"public.script", {"public.source-code"}},
    {"public.shell-script", {"public.script"}},
    {"public.python-script", {"public.script"}},
    {"public.delimited-values-text", {"public.text"}},
    {"public.comma-separated-values-text", {"public.delimited-values-text"}},
    {"public.tab-separated-values-text", {"public.delimited-values-text"}},
    {"public.vcard", {"public.text", "public.contact"}},
    {"public.calendar-text", {"public.text", "public.calendar-event"}},

    {"public.image", {"public.data", "public.content"}},
    {"public.jpeg", {"public.image"}},
    {"public.png", {"public.image"}},
    {"public.tiff", {"public.image"}},
    {"public.heic", {"public.image"}},
    {"public.gif", {"public.image"}},
    {"public.svg-image", {"public.image", "public.xml"}},

    {"public.audiovisual-content", {"public.data", "public.content"}},
    {"public.audio", {"public.audiovisual-content"}},
    {"public.mp3", {"public.audio"}},
    {"public.mpeg-4-audio", {"public.audio"}},
    {"public.aiff-audio", {"public.audio"}},
    {"public.movie", {"public.audiovisual-content"}},
    {"public.video", {"public.movie"}},
    {"public.mpeg-4", {"public.movie"}},
    {"public.quicktime-movie", {"public.movie"}},
    {"public.avi", {"public.movie"}},

    {"public.archive", {"public.data"}},
    {"public.zip-archive", {"public.archive"}},
    {"public.tar-archive", {"public.archive"}},
    {"org.gnu.gnu-zip-archive", {"public.archive"}},

    {"public.url", {"public.data"}},
    {"public.file-url", {"public.url"}},

    {"public.presentation", {"public.composite-content"}},
    {"public.spreadsheet", {"public.content"}},
    {"public.font", {"public.data", "public.content"}},
    {"com.adobe.pdf", {"public.data", "public.composite-content"}},
};

// The *.dmap files of directory, sorted so every load declares in the same order. Absent
// when the directory cannot be opened.
std::optional<std::vector<std::string>> typeFiles(const std::string& directory) {
  DIR* dir = ::opendir(directory.c_str());
  if (dir == nullptr) return std::nullopt;
  std::vector<std::string> names;
  while (const dirent* entry = ::readdir(dir)) {
    std::string_view name = entry->d_name;
    if (name.size() <= kFileSuffix.size() || name.front() == '.' || !name.ends_with(kFileSuffix)) {
      continue;
    }
    names.emplace_back(name);
  }
  ::closedir(dir);
  std::sort(names.begin(), names.end());
  return names;
}

// A file's declarations when the whole file is shaped as identifier -> array of parent
// identifiers; otherwise why not.
using Declarations = std::vector<std::pair<std::string, std::vector<std::string>>>;

std::variant<Declarations, std::string> declarationsOf(const Value& root) {
  const Dictionary* entries = root.dictionary();
  if (entries == nullptr) return std::string("the root is not a dictionary");
  Declarations declarations;
  declarations.reserve(entries->size());
  for (const auto& [type, value] : *entries) {
    if (type.empty()) return std::string("an empty type identifier");
    const Array* parents = value.array();
    if (parents == nullptr) return "the parents of " + type + " are not an array";
    if (parents->size() > kMaxParents) return type + " has too many parents";
    std::vector<std::string> names;
    names.reserve(parents->size());
    for (const Value& parent : *parents) {
      const std::string* name = parent.string();
      if (name == nullptr || name->empty()) {
        return "a parent of " + type + " is not a type identifier";
      }
      names.push_back(*name);
    }
    declarations.emplace_back(type, std::move(names));
  }
  return declarations;
}

// An item count or rule limit; the sum of counts saturates rather than wrapping.
uint64_t saturatingAdd(uint64_t a, uint64_t b) {
  return b > std::numeric_limits<uint64_t>::max() - a ? std::numeric_limits<uint64_t>::max()
                                                      : a + b;
}

// Whether count items stay within a rule's limit. Answers nothing for a limit that is not
// one.
std::optional<bool> withinLimit(uint64_t count, const Value& limit) {
  if (const bool* any = limit.boolean()) {
    if (!*any) return std::nullopt;
    return true;
  }
  if (const uint64_t* most = limit.unsignedNumber()) return count <= *most;
  if (limit.negativeNumber() != nullptr) return false;
  if (const double* most = limit.doubleNumber()) {
    if (std::isnan(*most)) return false;
    if (*most < 0) return false;
    // 2^64: every count fits below it.
    if (*most >= 18446744073709551616.0) return true;
    return count <= static_cast<uint64_t>(std::floor(*most));
  }
  return std::nullopt;
}

}  // namespace

TypeSystem::TypeSystem() {
  for (const BuiltIn& entry : kBuiltIn) {
    declare(entry.type, std::vector<std::string>(entry.parents.begin(), entry.parents.end()));
  }
}

void TypeSystem::declare(const std::string& type, std::vector<std::string> parents) {
  std::vector<std::string>& known = parents_[type];
  for (std::string& parent : parents) {
    if (std::find(known.begin(), known.end(), parent) == known.end()) {
      known.push_back(std::move(parent));
    }
  }
}

bool TypeSystem::reaches(std::string_view from, std::string_view to, size_t& budget) const {
  if (from == to) return true;
  std::unordered_set<std::string_view> visited{from};
  std::deque<std::string_view> pending{from};
  while (!pending.empty()) {
    auto it = parents_.find(pending.front());
    pending.pop_front();
    if (it == parents_.end()) continue;
    for (const std::string& parent : it->second) {
      if (budget == 0) return true;  // out of budget: treat as a cycle, so refuse the edge
      --budget;
      if (parent == to) return true;
      if (visited.insert(parent).second) pending.push_back(parent);
    }
  }
  return false;
}

std::shared_ptr<TypeSystem> TypeSystem::loadFrom(const std::string& directory) {
  auto system = std::make_shared<TypeSystem>();
  std::optional<std::vector<std::string>> files = typeFiles(directory);
  if (!files) {
    log::ops().debug("no type declarations in %{public}s", directory);
    return system;
  }
  if (files->size() > kMaxFiles) {
    log::ops().error("%{public}s holds more than %zu type files; reading the first ones", directory,
                     kMaxFiles);
    files->resize(kMaxFiles);
  }
  size_t declared = 0;
  size_t budget = kMaxCycleCheckVisits;
  for (const std::string& name : *files) {
    const std::string path = paths::join(directory, name);
    Result<Value> root = dmap::readFile(path);
    if (!root.ok()) {
      log::ops().error("skipping type file %{public}s: %{public}s", path, root.error().message);
      continue;
    }
    auto declarations = declarationsOf(*root);
    if (const std::string* problem = std::get_if<std::string>(&declarations)) {
      log::ops().error("skipping type file %{public}s: %{public}s", path, *problem);
      continue;
    }
    for (auto& [type, parents] : std::get<Declarations>(declarations)) {
      if (declared == kMaxDeclaredTypes) {
        log::ops().error("more than %zu declared types; ignoring the rest from %{public}s",
                         kMaxDeclaredTypes, path);
        return system;
      }
      ++declared;
      std::vector<std::string> accepted;
      for (std::string& parent : parents) {
        // The edge type -> parent closes a cycle when type is already parent or one of its
        // ancestors.
        if (system->reaches(parent, type, budget)) {
          log::ops().error(
              "ignoring %{public}s as parent of %{public}s in %{public}s: it would "
              "make a cycle",
              parent, type, path);
          continue;
        }
        accepted.push_back(std::move(parent));
        system->declare(type, {accepted.back()});
      }
      if (accepted.empty()) system->declare(type, {});
    }
  }
  return system;
}

std::shared_ptr<TypeSystem> TypeSystem::system() {
  static const std::shared_ptr<TypeSystem> loaded =
      loadFrom(paths::join(paths::systemRoot(), "Library/Types"));
  return loaded;
}

bool TypeSystem::conforms(std::string_view type, std::string_view supertype) const {
  // Hierarchies are acyclic by construction; the visited set also keeps the walk linear when
  // several paths lead to the same ancestor.
  size_t unlimited = std::numeric_limits<size_t>::max();
  return reaches(type, supertype, unlimited);
}

void TypeSystem::forEachAncestor(std::string_view type,
                                 const std::function<void(std::string_view)>& visit) const {
  std::unordered_set<std::string_view> visited{type};
  std::deque<std::string_view> pending{type};
  while (!pending.empty()) {
    std::string_view ancestor = pending.front();
    pending.pop_front();
    visit(ancestor);
    auto it = parents_.find(ancestor);
    if (it == parents_.end()) continue;
    for (const std::string& parent : it->second) {
      if (visited.insert(parent).second) pending.push_back(parent);
    }
  }
}

std::vector<std::string> TypeSystem::parents(std::string_view type) const {
  auto it = parents_.find(type);
  if (it == parents_.end()) return {};
  return it->second;
}

bool TypeSystem::evaluateActivationRule(const Value& rule, const Dictionary& items) const {
  const Dictionary* limits = rule.dictionary();
  if (limits == nullptr) return false;
  for (const auto& [type, limit] : *limits) {
    if (!withinLimit(0, limit)) return false;  // not a limit at all
  }
  // Walk each host type's ancestors once, crediting its items to every rule type among them:
  // the work is the host types times the hierarchy, whatever the size of the rule.
  std::map<std::string_view, uint64_t, std::less<>> counted;
  for (const auto& [type, countValue] : items) {
    const uint64_t* count = countValue.unsignedNumber();
    if (count == nullptr) return false;
    if (*count == 0) continue;
    bool covered = false;
    forEachAncestor(type, [&](std::string_view ancestor) {
      if (auto ruleEntry = limits->find(ancestor); ruleEntry != limits->end()) {
        covered = true;
        uint64_t& sum = counted[ruleEntry->first];
        sum = saturatingAdd(sum, *count);
      }
    });
    if (!covered) return false;
  }
  for (const auto& [type, limit] : *limits) {
    auto it = counted.find(type);
    if (!*withinLimit(it == counted.end() ? 0 : it->second, limit)) return false;
  }
  return true;
}

}  // namespace ek::types
