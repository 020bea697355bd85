// The annotation requests: "annotate" and "bulk-annotate".

#include "Ekora/EkProtocol.h"
#include "ekd/EkDPlugIn.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "ekd/Transaction.h"
#include "platform/log/Log.h"

namespace ek {
namespace {

constexpr std::string_view kElection = "election";
constexpr std::string_view kExtension = "extension";

bool isNumber(const Value& value) {
  return value.unsignedNumber() || value.negativeNumber() || value.doubleNumber();
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
    if (!isNumber(it->second)) {
      fail(protocol::kErrorInvalidRequest, "invalid request format (annotation election)");
      return;
    }
    change.emplace(kElection, it->second);
  }
  if (auto it = annotations->find(kExtension); it != annotations->end()) {
    if (!it->second.dictionary()) {
      fail(protocol::kErrorInvalidRequest, "invalid request format (annotation extension)");
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
  EkDServer& database = server();
  database.beginAnnotationChanges();
  beforeReply([&database] { database.commitAnnotationChanges(); });
  bool walked = processUuidList([&](const std::shared_ptr<EkDPlugIn>& plugIn) {
    std::string uuid = plugIn->uuid().string();
    std::string identifier = plugIn->identifier().value_or("(null)");
    log::ops().debug("client %d plug-in %{public}@(%{public}@) annotation change: %@",
                     client_->pid(), identifier, uuid, changeValue);
    if (election != change.end()) {
      log::ops().info("client %d plug-in %{public}@(%{public}@) election := %@", client_->pid(),
                      identifier, uuid, election->second);
    }
    database.setAnnotation(change, *plugIn);
    return true;
  });
  if (!walked) return;
  database.commitAnnotationChanges();
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
  EkDServer& database = server();
  database.beginAnnotationChanges();
  beforeReply([&database] { database.commitAnnotationChanges(); });
  for (const auto& [key, value] : *annotations) {
    if (!value.dictionary()) {
      fail(protocol::kErrorBadAnnotation, "annotations values must be dictionaries");
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
    database.setAnnotation(Dictionary{{std::string(kExtension), value}}, *plugIn);
  }
  database.commitAnnotationChanges();
  database.notifyAnnotationChange();
  done();
}

}  // namespace ek
