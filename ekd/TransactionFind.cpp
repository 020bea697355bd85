// The "find" request, and the annotations every outgoing form carries.

#include "Ekora/EkDaemonClient.h"
#include "Ekora/EkFileURL.h"
#include "Ekora/EkProtocol.h"
#include "ekd/EkDFormCache.h"
#include "ekd/EkDPlugIn.h"
#include "ekd/EkDServer.h"
#include "ekd/Handlers.h"
#include "platform/log/Log.h"

namespace ek::handlers {
namespace {

std::shared_ptr<EkDPlugIn> findPlugInByPathURL(EkDatabase& database, const std::string& text) {
  // A URL, not a bare path: text that does not parse as one locates nothing.
  auto url = EkFileURL::parse(text);
  if (!url) return nullptr;
  return database.findPlugInAtPath(url->string());
}

}  // namespace

Reply findPlugIn(const Request& request, EkDServer& daemon) {
  EkDatabase& database = daemon.database();
  std::shared_ptr<EkDPlugIn> plugIn;
  if (const Value* uuids = request.body.get(protocol::kUuids)) {
    if (const Uuid* uuid = uuids->uuid()) plugIn = database.findPlugIn(*uuid);
  }
  if (const std::string* paths = request.body.getString(protocol::kPaths)) {
    // A usable location decides, also over a UUID that found something.
    plugIn = findPlugInByPathURL(database, *paths);
  }
  if (!plugIn) {
    log::ops().defaultLevel("plugin not found");
    return Reply::failure(protocol::kErrorNotFound, "Cannot locate PlugIn");
  }
  log::ops().defaultLevel("plugin found %{public}@", *plugIn);
  // The kept encoded form, with what this request adds to it, as a match's reply carries it.
  EkDPlugIn::CurrentInfoRef current = plugIn->currentInfo();
  auto form = database.formCache().formFor(plugIn, current->info);
  if (form->error) {
    log::ops().error("failed to export matching plug-in %{public}@: %{public}@", plugIn->uuid(),
                     *form->error);
  }
  const EkDPlugIn* record = plugIn.get();
  EkDatabase::EncodedAnnotation annotation =
      database.encodedAnnotationsForPlugIns({&record, 1}).front();
  auto members = std::make_shared<Dictionary>();
  plugIn->augmentForm(*members, *current);
  if (!EkDaemonClient::convertsToWyre(request.version)) return Reply{};
  Reply reply;
  reply.encodedKey = protocol::kMatches;
  reply.writeEncoded = [form, annotation, members](std::vector<uint8_t>& out) {
    const EkDFormCache::Added added{annotation.span(), *members};
    out.reserve(out.size() + EkDFormCache::sizeBound(*form, added));
    EkDFormCache::write(*form, added, out);
  };
  return reply;
}

}  // namespace ek::handlers
