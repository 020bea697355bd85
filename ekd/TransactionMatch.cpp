// The "match" request: discovery.

#include <algorithm>
#include <unordered_map>

#include "Ekora/EkBundle.h"
#include "Ekora/EkCollections.h"
#include "Ekora/EkDaemonClient.h"
#include "Ekora/EkPlugInKeys.h"
#include "Ekora/EkProtocol.h"
#include "ekd/Duplicates.h"
#include "ekd/EkDFormCache.h"
#include "ekd/EkDPlugIn.h"
#include "ekd/EkDPlugInHold.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDUserPrefs.h"
#include "ekd/EkDWyreClient.h"
#include "ekd/Handlers.h"
#include "platform/cbor/Cbor.h"
#include "platform/log/Log.h"
#include "platform/process/Process.h"
#include "platform/trace/Probes.h"
#include "platform/wyre/Wyre.h"

namespace ek {
namespace {

namespace form = plugin::form;
using Candidates = std::vector<std::shared_ptr<EkDPlugIn>>;

// The version text of the plug-in's form: its version when that is a string, the no-version
// text when it has none, nothing for a version of another type.
std::optional<std::string_view> formVersion(const Value* version) {
  if (version == nullptr) return plugin::kNoVersion;
  if (const std::string* text = version->string()) return *text;
  return std::nullopt;
}

// One plug-in of the reply: its kept form, and what this reply adds to it.
struct Match {
  Match(std::shared_ptr<EkDPlugIn> plugIn, EkDPlugIn::CurrentInfoRef current,
        std::shared_ptr<const EkDFormCache::EncodedForm> form)
      : plugIn(std::move(plugIn)), current(std::move(current)), form(std::move(form)) {}
  std::shared_ptr<EkDPlugIn> plugIn;
  // What the plug-in was checked against; its version orders copies of one identifier.
  EkDPlugIn::CurrentInfoRef current;
  std::shared_ptr<const EkDFormCache::EncodedForm> form;
  Dictionary added;
};

// A plug-in inside the requesting host's own application wins over other copies of its
// identifier.
void preferBundleRelative(Candidates& candidates, const EkDClientProcess& client) {
  const std::string* executable = &client.path();
  if (executable->empty()) {
    log::ops().error("Failed to determine path for pid %d, %{errno}d", client.pid(), ESRCH);
    return;
  }
  std::unordered_map<std::string, std::shared_ptr<EkDPlugIn>> preferred;
  for (const auto& candidate : candidates) {
    auto containing = candidate->containingPath();
    if (!containing || !executable->starts_with(*containing)) continue;
    preferred[candidate->identifier().value_or("")] = candidate;
  }
  if (preferred.empty()) return;
  Candidates kept;
  kept.reserve(candidates.size());
  for (auto& candidate : candidates) {
    auto it = preferred.find(candidate->identifier().value_or(""));
    if (it == preferred.end() || it->second == candidate) {
      kept.push_back(std::move(candidate));
      continue;
    }
    log::ops().info("Ignoring %{public}@ @ '%{public}@' in favor of bundle-relative '%{public}@'",
                    candidate->uuid(), candidate->path().value_or("(null)"),
                    it->second->path().value_or("(null)"));
  }
  candidates = std::move(kept);
}

// A list of "%@(%@) %@" per candidate, as the info log shows it.
struct CandidateList {
  const Candidates& candidates;
  std::string description() const {
    Array lines;
    for (const auto& candidate : candidates) {
      lines.emplace_back(log::format("%@(%@) %@", candidate->identifier().value_or("(null)"),
                                     candidate->versionString().value_or("(null)"),
                                     candidate->uuid()));
    }
    return Value(std::move(lines)).description();
  }
};

// Whether candidate P wins over an earlier match X of the same identifier and version.
bool candidateWins(const DuplicateFilter::Weighed& plugIn,
                   const DuplicateFilter::Weighed& earlier) {
  bool earlierSystem = earlier.onSystemVolume();
  if (!plugIn.onSystemVolume() && earlierSystem) return false;
  if (plugIn.onSystemVolume() && !earlierSystem) return true;
  return plugIn.lastModified() > earlier.lastModified();
}

}  // namespace

DuplicateFilter::Verdict DuplicateFilter::admit(const Copy& copy) {
  const uint64_t flags = flags_;
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
      if (!(flags & protocol::kDiscoverKeepVersions)) {
        if (order > 0) {
          removeEarlier = true;
        } else if (order < 0) {
          dropped = true;
        } else if (candidateWins(plugIn, earlier)) {
          removeEarlier = true;
        } else {
          dropped = true;
        }
      } else if (order != 0 || (flags & protocol::kDiscoverKeepDuplicates)) {
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

namespace handlers {

Reply matchPlugIns(const Request& request, EkDServer& daemon) {
  const EkDClientProcess& sender = request.sender;
  std::optional<Dictionary> rules;
  if (const Value* value = request.body.get(protocol::kRules)) {
    if (!value->dictionary()) {
      return Reply::failure(protocol::kErrorInvalidRequest,
                            "invalid request format (bad rules dictionary)");
    }
    rules = *value->dictionary();
  }
  const uint64_t* flagsValue = request.body.getUnsigned(protocol::kFlags);
  const uint64_t flags = flagsValue ? *flagsValue : 0;
  const bool all = flags & protocol::kDiscoverAll;
  if (all && (!sender.hasEntitlement(protocol::kEntitlementManager) || sender.isSandboxed())) {
    return Reply::failure(protocol::kErrorNotPermitted,
                          "unauthorized discovery flag (EkDiscoverAll)");
  }

  EkDatabase& database = daemon.database();
  std::optional<Value> exclusionsValue = daemon.userPrefs()->exclusions();
  Candidates candidates = database.findPlugIns(rules.value_or(Dictionary{})).value_or(Candidates{});
  EK_PROBE1(discover_raw, static_cast<uint64_t>(candidates.size()));
  if (log::ops().enabled(log::Level::Info)) {
    if (candidates.empty()) {
      log::ops().info("Candidate plugin count: 0");
    } else {
      log::ops().info("Candidate plugin count: %u, info: %{public}@", candidates.size(),
                      CandidateList{candidates});
    }
  }
  preferBundleRelative(candidates, sender);

  // The exclusions are walked as a list of rules; anything else in it excludes nothing.
  std::vector<const Dictionary*> exclusions;
  if (exclusionsValue) {
    if (const Array* list = exclusionsValue->array()) {
      for (const Value& element : *list) {
        if (const Dictionary* rule = element.dictionary()) exclusions.push_back(rule);
      }
    }
  }
  std::optional<std::string> pluginsPath;
  if (const auto& bundle = sender.bundle()) pluginsPath = bundle->plugInsPath();

  // Matches are shared with the override table: a replacing plug-in removed from the results
  // by a newer copy still marks the plug-ins it replaces. A removed match leaves an empty slot,
  // so that the positions recorded per identifier stay valid.
  using MatchRef = std::shared_ptr<Match>;
  std::vector<MatchRef> results;
  DuplicateFilter duplicates(flags, candidates.size());
  std::unordered_map<std::string, MatchRef> overrides;
  const Dictionary* matchRules = rules ? &*rules : nullptr;
  EkDFormCache& forms = database.formCache();
  // The holds as they stand now decide for every candidate.
  const std::shared_ptr<const EkDPlugInHolds> holds = daemon.holds();
  for (const auto& plugIn : candidates) {
    EkDPlugIn::CurrentInfoRef current = plugIn->currentInfo();
    if (!all) {
      if (!plugIn->onSystemVolume()) {
        if (!plugIn->containingUrl()) continue;
        if (flags & protocol::kDiscoverSystemOnly) continue;
      }
      if (current->dedicated) {
        auto path = plugIn->path();
        if (!pluginsPath || !path || !path->starts_with(*pluginsPath)) continue;
      }
      if (holds->blocks(*plugIn)) continue;
    }
    if (!plugIn->match(matchRules, *current)) continue;
    bool excluded = false;
    for (const Dictionary* exclusion : exclusions) {
      if (plugIn->match(exclusion, *current)) {
        log::ops().info("client %d plugin %{public}@ globally excluded", request.pid,
                        plugIn->uuid());
        excluded = true;
        break;
      }
    }
    if (excluded) continue;
    if (!all) {
      if (auto reason = plugIn->allowForClient(sender, *current)) {
        log::ops().info("client %d cannot use plugin %{public}@: %{public}@", request.pid,
                        plugIn->uuid(), *reason);
        continue;
      }
    }
    auto match = std::make_shared<Match>(plugIn, current, forms.formFor(plugIn, current->info));
    if (match->form->error) {
      log::ops().error("failed to export matching plug-in %{public}@: %{public}@", plugIn->uuid(),
                       *match->form->error);
    }

    const DuplicateFilter::Verdict verdict = duplicates.admit(
        {plugIn->identifier(), current->version, plugIn->onSystemVolume(), plugIn->lastModified()});
    if (!verdict.kept) continue;
    if (verdict.replaces) results[*verdict.replaces] = nullptr;

    plugIn->augmentForm(match->added, *current);
    results.push_back(match);
    if (auto replaces = plugIn->valueForEntitlement(protocol::kEntitlementReplacePlugIn)) {
      if (const std::string* name = replaces->string()) {
        overrides[*name] = match;
      } else if (const Array* names = replaces->array()) {
        for (const Value& element : *names) {
          if (const std::string* name = element.string()) overrides[*name] = match;
        }
      }
    }
  }

  std::erase(results, nullptr);
  std::vector<EkDatabase::EncodedAnnotation> annotations;
  {
    std::vector<const EkDPlugIn*> matched;
    matched.reserve(results.size());
    for (const MatchRef& result : results) matched.push_back(result->plugIn.get());
    annotations = database.encodedAnnotationsForPlugIns(matched);
  }
  for (const MatchRef& replaced : results) {
    if (overrides.empty()) break;
    const std::optional<std::string> identifier = replaced->plugIn->identifier();
    if (!identifier) continue;
    auto it = overrides.find(*identifier);
    if (it == overrides.end()) continue;
    Match& overrider = *it->second;
    const std::string overriderUuid = overrider.plugIn->uuid().string();
    replaced->added.insert_or_assign(std::string(form::kOverrider), Value(overriderUuid));
    overrider.added.insert_or_assign(std::string(form::kOverriding), Value(*identifier));
    log::ops().info("plug-in %{public}@ overrides %{public}@", overriderUuid,
                    replaced->plugIn->uuid().string());
  }

  if (log::ops().enabled(log::Level::Info)) {
    if (results.empty()) {
      log::ops().info("Resulting plugin count: 0");
    } else {
      Array uuids;
      for (const MatchRef& result : results) uuids.emplace_back(result->plugIn->uuid().string());
      log::ops().info("Resulting plugin count: %u, UUIDs: %{public}@", results.size(),
                      Value(std::move(uuids)));
    }
  }
  log::ops().debug("reply marshalled");
  if (!EkDaemonClient::convertsToWyre(request.version)) return Reply{};
  Reply reply;
  reply.encodedKey = protocol::kMatches;
  // Written once the handler has returned: the writer keeps what it writes.
  auto kept = std::make_shared<std::pair<std::vector<MatchRef>, decltype(annotations)>>(
      std::move(results), std::move(annotations));
  reply.writeEncoded = [kept](std::vector<uint8_t>& out) {
    const auto& [results, annotations] = *kept;
    size_t bound = 9;
    for (size_t i = 0; i < results.size(); ++i) {
      bound +=
          EkDFormCache::sizeBound(*results[i]->form, {annotations[i].span(), results[i]->added});
    }
    // A reply larger than a frame is answered with an error instead: what lies beyond the
    // limit is neither reserved nor written.
    const size_t limit = wyre::kHeaderSize + wyre::kMaxBodySize;
    out.reserve(std::min(out.size() + bound, limit + 1));
    cbor::encodeArrayHead(results.size(), out);
    for (size_t i = 0; i < results.size() && out.size() <= limit; ++i) {
      EkDFormCache::write(*results[i]->form, {annotations[i].span(), results[i]->added}, out);
    }
  };
  return reply;
}

}  // namespace handlers
}  // namespace ek
