// The "find" request, and the annotations every outgoing form carries.

#include "Ekora/EkDaemonClient.h"
#include "Ekora/EkFileURL.h"
#include "Ekora/EkProtocol.h"
#include "ekd/EkDFormCache.h"
#include "ekd/EkDPlugIn.h"
#include "ekd/EkDServer.h"
#include "ekd/Transaction.h"
#include "platform/log/Log.h"

namespace ek {

std::shared_ptr<EkDPlugIn> Transaction::findPlugInByUUID(const Uuid& uuid) {
  return server().database().findPlugIn(uuid);
}

std::shared_ptr<EkDPlugIn> Transaction::findPlugInByPathURL(const std::string& text) {
  // A URL, not a bare path: text that does not parse as one locates nothing.
  auto url = EkFileURL::parse(text);
  if (!url) return nullptr;
  return server().database().findPlugInAtPath(url->string());
}

void Transaction::findPlugIn() {
  std::shared_ptr<EkDPlugIn> plugIn;
  if (const Value* uuids = request_.body.get(protocol::kUuids)) {
    if (const Uuid* uuid = uuids->uuid()) plugIn = findPlugInByUUID(*uuid);
  }
  if (const std::string* paths = request_.body.getString(protocol::kPaths)) {
    // A usable location decides, also over a UUID that found something.
    plugIn = findPlugInByPathURL(*paths);
  }
  if (!plugIn) {
    log::ops().defaultLevel("plugin not found");
    fail(protocol::kErrorNotFound, "Cannot locate PlugIn");
    return;
  }
  log::ops().defaultLevel("plugin found %{public}@", *plugIn);
  // The kept encoded form, with what this request adds to it, as a match's reply carries it.
  EkDPlugIn::CurrentInfoRef current = plugIn->currentInfo();
  auto form = server().database().formCache().formFor(plugIn, current->info);
  if (form->error) {
    log::ops().error("failed to export matching plug-in %{public}@: %{public}@", plugIn->uuid(),
                     *form->error);
  }
  const EkDPlugIn* record = plugIn.get();
  EkDatabase::EncodedAnnotation annotation =
      server().database().encodedAnnotationsForPlugIns({&record, 1}).front();
  Dictionary members;
  plugIn->augmentForm(members, *current);
  if (!EkDaemonClient::convertsToWyre(version())) {
    done();
    return;
  }
  doneWithEncoded(protocol::kMatches, [&](std::vector<uint8_t>& out) {
    const EkDFormCache::Added added{annotation.span(), members};
    out.reserve(out.size() + EkDFormCache::sizeBound(*form, added));
    EkDFormCache::write(*form, added, out);
  });
}

}  // namespace ek
