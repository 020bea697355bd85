#include "ekd/Duplicates.h"

#include "Ekora/EkCollections.h"
#include "Ekora/EkPlugInKeys.h"
#include "Ekora/EkProtocol.h"

namespace ek {
namespace {

// The version text of the plug-in's form: its version when that is a string, the no-version
// text when it has none, nothing for a version of another type.
std::optional<std::string_view> formVersion(const Value* version) {
  if (version == nullptr) return plugin::kNoVersion;
  if (const std::string* text = version->string()) return *text;
  return std::nullopt;
}

// Whether candidate P wins over an earlier match X of the same identifier and version.
bool candidateWins(const DuplicateFilter::Weighed& plugIn,
                   const DuplicateFilter::Weighed& earlier) {
  if (!plugIn.system && earlier.system) return false;
  if (plugIn.system && !earlier.system) return true;
  return plugIn.modified > earlier.modified;
}

}  // namespace

DuplicateFilter::Verdict DuplicateFilter::admit(const Copy& copy) {
  const std::string* version = copy.version ? copy.version->string() : nullptr;
  Weighed plugIn{std::string(formVersion(copy.version).value_or(std::string_view())), copy.system,
                 copy.modified};
  Verdict verdict;
  bool dropped = false;
  // Without an identifier a match is weighed against those named "", without a copy of either.
  static const std::string kNoIdentifier;
  auto sameIdentifier = accepted_.find(copy.identifier ? *copy.identifier : kNoIdentifier);
  if (sameIdentifier != accepted_.end()) {
    auto& positions = sameIdentifier->second;
    for (auto position = positions.begin(); position != positions.end(); ++position) {
      const Weighed& earlier = position->second;
      auto order = compareVersionString(version, earlier.version);
      bool removeEarlier = false;
      bool stop = true;
      if (!(flags_ & protocol::kDiscoverKeepVersions)) {
        if (order > 0) {
          removeEarlier = true;
        } else if (order < 0) {
          dropped = true;
        } else if (candidateWins(plugIn, earlier)) {
          removeEarlier = true;
        } else {
          dropped = true;
        }
      } else if (order != 0 || (flags_ & protocol::kDiscoverKeepDuplicates)) {
        stop = false;
      } else if (candidateWins(plugIn, earlier)) {
        removeEarlier = true;
      } else {
        dropped = true;
      }
      if (removeEarlier) {
        verdict.replaces = position->first;
        positions.erase(position);
      }
      if (stop) break;
    }
  }
  if (dropped) return verdict;
  verdict.kept = true;
  if (copy.identifier) {
    if (sameIdentifier == accepted_.end()) {
      sameIdentifier = accepted_.try_emplace(*copy.identifier).first;
    }
    sameIdentifier->second.emplace_back(next_, std::move(plugIn));
  }
  ++next_;
  return verdict;
}

}  // namespace ek
