// The "match" request: discovery.

#include <algorithm>
#include <unordered_map>

#include "Ekora/EkBundle.h"
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

}  // namespace

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
