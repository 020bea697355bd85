// The annotation requests: "annotate" and "bulk-annotate".

#include <fmt/format.h>

#include "Ekora/EkProtocol.h"
#include "ekd/EkDPlugIn.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "ekd/Handlers.h"
#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"

namespace ek {
namespace {

constexpr std::string_view kElection = "election";
constexpr std::string_view kExtension = "extension";

// An annotation's entries sit this deep in the annotation file: its root dictionary, "data",
// the annotation, then the entry.
constexpr size_t kAnnotationEntryDepth = 3;

// Whether the annotation file can hold value as an entry of an annotation; the reason when not.
std::optional<std::string> unstorable(const Value& value) {
  Result<void> checked = dmap::checkWritable(value, kAnnotationEntryDepth);
  if (checked.ok()) return std::nullopt;
  return checked.error().message;
}

// The code a reply gives a change that could not be stored: a system error is answered as
// itself (errno, the POSIX domain's code), a refusal of the store keeps its own code.
int32_t replyCode(const EkError& error) {
  if (error.isEkora() || error.domain == kPosixErrorDomain) return error.code;
  return protocol::kErrorInvalidRequest;
}

Reply failStore(const EkError& error) {
  return Reply::failure(replyCode(error), error.description());
}

// Whatever way the changes begun with beginAnnotationChanges end, they reach the disk before the
// reply leaves; when they cannot, they are undone and the reply says so instead of outcome.
// Posts the change once when it was made and kept.
Reply committed(EkDatabase& database, Reply outcome) {
  if (Result<void> saved = database.commitAnnotationChanges(); !saved.ok()) {
    return failStore(saved.error());
  }
  if (!outcome.failed()) database.notifyAnnotationChange();
  return outcome;
}

}  // namespace

namespace handlers {

Reply annotatePlugIns(const Request& request, EkDServer& daemon) {
  const Dictionary* annotations = request.body.getDictionary(protocol::kAnnotations);
  if (!annotations) {
    return Reply::failure(protocol::kErrorInvalidRequest,
                          "invalid request format (bad annotations dictionary)");
  }
  Dictionary change;
  if (auto it = annotations->find(kElection); it != annotations->end()) {
    std::optional<int64_t> election = EkDPlugIn::electionNumber(it->second);
    if (!election) {
      return Reply::failure(protocol::kErrorInvalidRequest,
                            "invalid request format (annotation election)");
    }
    if (std::optional<std::string> reason = unstorable(it->second)) {
      return Reply::failure(
          protocol::kErrorInvalidRequest,
          fmt::format("invalid request format (annotation election): {}", *reason));
    }
    // Stored as the number it stands for, so every reader sees the same election.
    change.emplace(kElection, it->second.boolean() ? Value(*election) : it->second);
  }
  if (auto it = annotations->find(kExtension); it != annotations->end()) {
    if (!it->second.dictionary()) {
      return Reply::failure(protocol::kErrorInvalidRequest,
                            "invalid request format (annotation extension)");
    }
    if (std::optional<std::string> reason = unstorable(it->second)) {
      return Reply::failure(
          protocol::kErrorInvalidRequest,
          fmt::format("invalid request format (annotation extension): {}", *reason));
    }
    change.emplace(kExtension, it->second);
  }
  if (change.empty()) return Reply{};

  const Value changeValue(change);
  auto election = change.find(kElection);
  EkDatabase& database = daemon.database();
  database.beginAnnotationChanges();
  Step failure =
      forEachListedPlugIn(request, daemon, [&](const std::shared_ptr<EkDPlugIn>& plugIn) -> Step {
        std::string uuid = plugIn->uuid().string();
        std::string identifier = plugIn->identifier().value_or("(null)");
        log::ops().debug("client %d plug-in %{public}@(%{public}@) annotation change: %@",
                         request.pid, identifier, uuid, changeValue);
        if (election != change.end()) {
          log::ops().info("client %d plug-in %{public}@(%{public}@) election := %@", request.pid,
                          identifier, uuid, election->second);
        }
        if (Result<void> set = database.setAnnotation(change, *plugIn); !set.ok()) {
          return failStore(set.error());
        }
        return std::nullopt;
      });
  return committed(database, failure ? std::move(*failure) : Reply{});
}

namespace {

// The changes of a bulk annotation, up to the first that fails.
Step bulkAnnotate(const Request& request, EkDatabase& database, const Dictionary& annotations) {
  for (const auto& [key, value] : annotations) {
    if (!value.dictionary()) {
      return Reply::failure(protocol::kErrorBadAnnotation,
                            "annotations values must be dictionaries");
    }
    if (std::optional<std::string> reason = unstorable(value)) {
      return Reply::failure(protocol::kErrorBadAnnotation,
                            fmt::format("annotations values must be storable: {}", *reason));
    }
    auto uuid = Uuid::parse(key);
    if (!uuid) return Reply::failure(protocol::kErrorBadAnnotation, "invalid plug-in UUID value");
    auto plugIn = database.findPlugIn(*uuid);
    if (!plugIn) {
      return Reply::failure(protocol::kErrorRegistry, "no plug-in with the requested uuid");
    }
    log::ops().debug("client %d bulk plug-in %{public}@(%public}@) annotation change: %@",
                     request.pid, plugIn->identifier().value_or("(null)"), plugIn->uuid().string(),
                     value);
    Result<void> set =
        database.setAnnotation(Dictionary{{std::string(kExtension), value}}, *plugIn);
    if (!set.ok()) return failStore(set.error());
  }
  return std::nullopt;
}

}  // namespace

Reply bulkAnnotatePlugIns(const Request& request, EkDServer& daemon) {
  const Dictionary* annotations = request.body.getDictionary(protocol::kAnnotations);
  if (!annotations) {
    return Reply::failure(protocol::kErrorInvalidRequest,
                          "invalid request format (bad annotations dictionary)");
  }
  log::ops().debug("bulk change requested for %u plug-ins", annotations->size());
  EkDatabase& database = daemon.database();
  database.beginAnnotationChanges();
  Step failure = bulkAnnotate(request, database, *annotations);
  return committed(database, failure ? std::move(*failure) : Reply{});
}

}  // namespace handlers
}  // namespace ek
