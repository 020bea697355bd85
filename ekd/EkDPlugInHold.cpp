#include "ekd/EkDPlugInHold.h"

#include <unordered_set>

namespace ek {

std::shared_ptr<EkDPlugInHold> EkDPlugInHold::initWithPlugIns(
    const std::vector<std::shared_ptr<EkDPlugIn>>& plugIns,
    const std::shared_ptr<EkDWyreClient>& client,
    std::shared_ptr<stard::ServiceManager> serviceManager) {
  auto hold = std::shared_ptr<EkDPlugInHold>(new EkDPlugInHold());
  hold->uuid_ = Uuid::random();
  std::unordered_set<Uuid> seen;
  for (const auto& plugIn : plugIns) {
    if (plugIn && seen.insert(plugIn->uuid()).second) hold->blocked_.push_back(plugIn);
  }
  hold->client_ = client;
  hold->created_ = std::chrono::system_clock::now();
  hold->serviceManager_ = std::move(serviceManager);
  if (hold->serviceManager_) hold->serviceManager_->beginTransaction();
  return hold;
}

EkDPlugInHold::~EkDPlugInHold() {
  if (serviceManager_) serviceManager_->endTransaction();
}

bool EkDPlugInHold::blocks(const EkDPlugIn& plugIn) const {
  Uuid uuid = plugIn.uuid();
  for (const auto& blocked : blocked_) {
    if (blocked->uuid() == uuid) return true;
  }
  return false;
}

}  // namespace ek

namespace ek {

bool EkDPlugInHold::placedBy(const std::shared_ptr<EkDWyreClient>& client) const {
  // Owner comparison stays exact after the record is gone: the weak reference keeps its
  // control block, so no later record can share it.
  return !client_.owner_before(client) && !client.owner_before(client_);
}

}  // namespace ek
