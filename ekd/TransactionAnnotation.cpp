// The annotation requests: "annotate" and "bulk-annotate".

#include <fmt/format.h>

#include "Ekora/EkProtocol.h"
#include "ekd/EkDPlugIn.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "ekd/Transaction.h"
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

void failStore(Transaction& transaction, const EkError& error) {
  transaction.fail(replyCode(error), error.description());
}

// Whatever way the request ends, what it changed reaches the disk before the reply leaves; when
// it cannot, the changes are undone and the reply says so instead.
void commitBeforeReply(Transaction& transaction, EkDatabase& database) {
  transaction.beforeReply([&transaction, &database] {
    Result<void> committed = database.commitAnnotationChanges();
    if (committed.ok()) return;
    const int32_t code = replyCode(committed.error());
    transaction.reply()[std::string(protocol::kErrorCode)] =
        Value(static_cast<uint64_t>(static_cast<int64_t>(code)));
    transaction.reply()[std::string(protocol::kError)] = Value(committed.error().description());
  });
}

}  // namespace

void Transaction::annotatePlugIns() {
  const Dictionary* annotations = dictionaryForKey(protocol::kAnnotations);
  if (!annotations) {
    fail(protocol::kErrorInvalidRequest, "invalid request format (bad annotations dictionary)");
    return;
  }
  Dictionary change;
  if (auto it = annotations->find(kElection); it != annotations->end()) {
    std::optional<int64_t> election = EkDPlugIn::electionNumber(it->second);
    if (!election) {
      fail(protocol::kErrorInvalidRequest, "invalid request format (annotation election)");
      return;
    }
    if (std::optional<std::string> reason = unstorable(it->second)) {
      fail(protocol::kErrorInvalidRequest,
           fmt::format("invalid request format (annotation election): {}", *reason));
      return;
    }
    // Stored as the number it stands for, so every reader sees the same election.
    change.emplace(kElection, it->second.boolean() ? Value(*election) : it->second);
  }
  if (auto it = annotations->find(kExtension); it != annotations->end()) {
    if (!it->second.dictionary()) {
      fail(protocol::kErrorInvalidRequest, "invalid request format (annotation extension)");
      return;
    }
    if (std::optional<std::string> reason = unstorable(it->second)) {
      fail(protocol::kErrorInvalidRequest,
           fmt::format("invalid request format (annotation extension): {}", *reason));
      return;
    }
    change.emplace(kExtension, it->second);
  }
  if (change.empty()) {
    done();
    return;
  }

  const Value changeValue(change);
  auto election = change.find(kElection);
  EkDatabase& database = server().database();
  database.beginAnnotationChanges();
  commitBeforeReply(*this, database);
  bool walked = processUuidList([&](const std::shared_ptr<EkDPlugIn>& plugIn) {
    std::string uuid = plugIn->uuid().string();
    std::string identifier = plugIn->identifier().value_or("(null)");
    log::ops().debug("client %d plug-in %{public}@(%{public}@) annotation change: %@",
                     client_->pid(), identifier, uuid, changeValue);
    if (election != change.end()) {
      log::ops().info("client %d plug-in %{public}@(%{public}@) election := %@", client_->pid(),
                      identifier, uuid, election->second);
    }
    if (Result<void> set = database.setAnnotation(change, *plugIn); !set.ok()) {
      failStore(*this, set.error());
      return false;
    }
    return true;
  });
  if (!walked) return;
  beforeReply(nullptr);
  if (Result<void> committed = database.commitAnnotationChanges(); !committed.ok()) {
    failStore(*this, committed.error());
    return;
  }
  database.notifyAnnotationChange();
  done();
}

void Transaction::bulkAnnotatePlugIns() {
  const Dictionary* annotations = dictionaryForKey(protocol::kAnnotations);
  if (!annotations) {
    fail(protocol::kErrorInvalidRequest, "invalid request format (bad annotations dictionary)");
    return;
  }
  log::ops().debug("bulk change requested for %u plug-ins", annotations->size());
  EkDatabase& database = server().database();
  database.beginAnnotationChanges();
  commitBeforeReply(*this, database);
  for (const auto& [key, value] : *annotations) {
    if (!value.dictionary()) {
      fail(protocol::kErrorBadAnnotation, "annotations values must be dictionaries");
      return;
    }
    if (std::optional<std::string> reason = unstorable(value)) {
      fail(protocol::kErrorBadAnnotation,
           fmt::format("annotations values must be storable: {}", *reason));
      return;
    }
    auto uuid = Uuid::parse(key);
    if (!uuid) {
      fail(protocol::kErrorBadAnnotation, "invalid plug-in UUID value");
      return;
    }
    auto plugIn = database.findPlugIn(*uuid);
    if (!plugIn) {
      fail(protocol::kErrorRegistry, "no plug-in with the requested uuid");
      return;
    }
    log::ops().debug("client %d bulk plug-in %{public}@(%public}@) annotation change: %@",
                     client_->pid(), plugIn->identifier().value_or("(null)"),
                     plugIn->uuid().string(), value);
    Result<void> set =
        database.setAnnotation(Dictionary{{std::string(kExtension), value}}, *plugIn);
    if (!set.ok()) {
      failStore(*this, set.error());
      return;
    }
  }
  beforeReply(nullptr);
  if (Result<void> committed = database.commitAnnotationChanges(); !committed.ok()) {
    failStore(*this, committed.error());
    return;
  }
  database.notifyAnnotationChange();
  done();
}

}  // namespace ek
