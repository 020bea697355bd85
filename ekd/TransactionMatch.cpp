// The "match" request: discovery.

#include <unordered_map>

#include "Ekora/EkBundle.h"
#include "Ekora/EkCollections.h"
#include "Ekora/EkDaemonClient.h"
#include "Ekora/EkPlugInKeys.h"
#include "Ekora/EkProtocol.h"
#include "ekd/EkDPlugIn.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDUserPrefs.h"
#include "ekd/EkDWyreClient.h"
#include "ekd/Transaction.h"
#include "platform/log/Log.h"
#include "platform/process/Process.h"
#include "platform/trace/Probes.h"

namespace ek {
namespace {

namespace form = plugin::form;
using Candidates = std::vector<std::shared_ptr<EkDPlugIn>>;

const std::string* stringIn(const Dictionary& dictionary, std::string_view key) {
  auto it = dictionary.find(key);
  return it == dictionary.end() ? nullptr : it->second.string();
}

int32_t lastModifiedIn(const Dictionary& form) {
  auto it = form.find(form::kLastModified);
  if (it == form.end()) return 0;
  if (const uint64_t* u = it->second.unsignedNumber()) return static_cast<int32_t>(*u);
  if (const int64_t* i = it->second.negativeNumber()) return static_cast<int32_t>(*i);
  return 0;
}

bool systemResidentIn(const Dictionary& form) {
  auto it = form.find(form::kSystemResident);
  return it != form.end() && it->second.boolean() && *it->second.boolean();
}

// Whether candidate P wins over the earlier form X of the same identifier and version.
bool candidateWins(const EkDPlugIn& plugIn, const Dictionary& earlier) {
  bool earlierSystem = systemResidentIn(earlier);
  if (!plugIn.onSystemVolume() && earlierSystem) return false;
  if (plugIn.onSystemVolume() && !earlierSystem) return true;
  return plugIn.lastModified() > lastModifiedIn(earlier);
}

// A plug-in inside the requesting host's own application wins over other copies of its
// identifier.
void preferBundleRelative(Candidates& candidates, const EkDWyreClient& client) {
  if (!client.connection()) return;
  auto executable = executablePathForPid(client.pid());
  if (!executable) {
    log::ops().error("Failed to determine path for pid %d, %{errno}d", client.pid(), errno);
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

void Transaction::matchPlugIns() {
  std::optional<Dictionary> rules;
  if (const Value* value = request_.body.get(protocol::kRules)) {
    if (!value->dictionary()) {
      fail(protocol::kErrorInvalidRequest, "invalid request format (bad rules dictionary)");
      return;
    }
    rules = *value->dictionary();
  }
  const uint64_t* flagsValue = request_.body.getUnsigned(protocol::kFlags);
  const uint64_t flags = flagsValue ? *flagsValue : 0;
  const bool all = flags & protocol::kDiscoverAll;
  if (all && (!client_->hasEntitlement(protocol::kEntitlementManager) || client_->isSandboxed())) {
    fail(protocol::kErrorNotPermitted, "unauthorized discovery flag (EkDiscoverAll)");
    return;
  }

  EkDServer& database = server();
  std::optional<Value> exclusionsValue = database.userPrefs()->exclusions();
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
  preferBundleRelative(candidates, *client_);

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
  if (const auto& bundle = client_->bundle()) pluginsPath = bundle->plugInsPath();

  // Forms are shared with the override table: a replacing form removed from the results by a
  // newer copy still marks the plug-ins it replaces. A removed form leaves an empty slot, so
  // that the positions recorded per identifier stay valid.
  using FormRef = std::shared_ptr<Dictionary>;
  std::vector<FormRef> results;
  std::unordered_map<std::string, std::vector<size_t>> accepted;
  std::unordered_map<std::string, FormRef> overrides;
  const Dictionary* matchRules = rules ? &*rules : nullptr;
  for (const auto& plugIn : candidates) {
    if (!all) {
      if (!plugIn->onSystemVolume()) {
        if (!plugIn->containingUrl()) continue;
        if (flags & protocol::kDiscoverSystemOnly) continue;
      }
      if (plugIn->isDedicated()) {
        auto path = plugIn->path();
        if (!pluginsPath || !path || !path->starts_with(*pluginsPath)) continue;
      }
      if (database.holdOnPlugIn(*plugIn)) continue;
    }
    if (!plugIn->match(matchRules)) continue;
    bool excluded = false;
    for (const Dictionary* exclusion : exclusions) {
      if (plugIn->match(exclusion)) {
        log::ops().info("client %d plugin %{public}@ globally excluded", client_->pid(),
                        plugIn->uuid());
        excluded = true;
        break;
      }
    }
    if (excluded) continue;
    if (!all) {
      if (auto reason = plugIn->allowForClient(*client_)) {
        log::ops().info("client %d cannot use plugin %{public}@: %{public}@", client_->pid(),
                        plugIn->uuid(), *reason);
        continue;
      }
    }
    auto exported = plugIn->exportForm();
    if (exported.error) {
      log::ops().error("failed to export matching plug-in %{public}@: %{public}@", plugIn->uuid(),
                       *exported.error);
    }
    Dictionary& form = exported.form;

    // De-duplication against the forms accepted so far with the same identifier, earliest
    // first; the index keeps this linear in the number of candidates.
    const std::string identifier = plugIn->identifier().value_or("");
    const std::optional<std::string> version = plugIn->versionString();
    bool dropped = false;
    auto sameIdentifier = accepted.find(identifier);
    if (sameIdentifier != accepted.end()) {
      std::vector<size_t>& positions = sameIdentifier->second;
      for (auto position = positions.begin(); position != positions.end(); ++position) {
        const Dictionary& earlier = *results[*position];
        const std::string* otherVersion = stringIn(earlier, form::kVersion);
        auto order = compareVersionString(version ? &*version : nullptr,
                                          otherVersion ? std::string_view(*otherVersion) : "");
        bool removeEarlier = false;
        bool stop = true;
        if (!(flags & protocol::kDiscoverKeepVersions)) {
          if (order > 0) {
            removeEarlier = true;
          } else if (order < 0) {
            dropped = true;
          } else if (candidateWins(*plugIn, earlier)) {
            removeEarlier = true;
          } else {
            dropped = true;
          }
        } else if (order != 0 || (flags & protocol::kDiscoverKeepDuplicates)) {
          stop = false;
        } else if (candidateWins(*plugIn, earlier)) {
          removeEarlier = true;
        } else {
          dropped = true;
        }
        if (removeEarlier) {
          results[*position] = nullptr;
          positions.erase(position);
        }
        if (stop) break;
      }
    }
    if (dropped) continue;

    addAnnotationForPlugIn(*plugIn, form);
    plugIn->augmentForm(form);
    if (const std::string* formIdentifier = stringIn(form, form::kIdentifier)) {
      accepted[*formIdentifier].push_back(results.size());
    }
    auto kept = std::make_shared<Dictionary>(std::move(form));
    results.push_back(kept);
    if (auto replaces = plugIn->valueForEntitlement(protocol::kEntitlementReplacePlugIn)) {
      if (const std::string* name = replaces->string()) {
        overrides[*name] = kept;
      } else if (const Array* names = replaces->array()) {
        for (const Value& element : *names) {
          if (const std::string* name = element.string()) overrides[*name] = kept;
        }
      }
    }
  }

  std::erase(results, nullptr);
  for (const FormRef& result : results) {
    if (overrides.empty()) break;
    Dictionary& replaced = *result;
    const std::string* identifier = stringIn(replaced, form::kIdentifier);
    if (!identifier) continue;
    auto it = overrides.find(*identifier);
    if (it == overrides.end()) continue;
    Dictionary& overrider = *it->second;
    const std::string* overriderUuid = stringIn(overrider, form::kUuid);
    const std::string* replacedUuid = stringIn(replaced, form::kUuid);
    replaced.insert_or_assign(std::string(form::kOverrider),
                              Value(overriderUuid ? *overriderUuid : std::string()));
    overrider.insert_or_assign(std::string(form::kOverriding), Value(*identifier));
    log::ops().info("plug-in %{public}@ overrides %{public}@",
                    overriderUuid ? std::string_view(*overriderUuid) : "(null)",
                    replacedUuid ? std::string_view(*replacedUuid) : "(null)");
  }

  if (log::ops().enabled(log::Level::Info)) {
    if (results.empty()) {
      log::ops().info("Resulting plugin count: 0");
    } else {
      Array uuids;
      for (const FormRef& result : results) {
        auto it = result->find(form::kUuid);
        uuids.push_back(it == result->end() ? Value() : it->second);
      }
      log::ops().info("Resulting plugin count: %u, UUIDs: %{public}@", results.size(),
                      Value(std::move(uuids)));
    }
  }
  Array matches;
  matches.reserve(results.size());
  for (const FormRef& result : results) matches.emplace_back(std::move(*result));
  if (auto converted = EkDaemonClient::convertToWyre(Value(std::move(matches)), version())) {
    reply_.insert_or_assign(std::string(protocol::kMatches), std::move(*converted));
  }
  log::ops().debug("reply marshalled");
  done();
}

}  // namespace ek
