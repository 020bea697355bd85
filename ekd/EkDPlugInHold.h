#pragma once

#include <chrono>
#include <memory>
#include <unordered_set>
#include <vector>

#include "ekd/EkDPlugIn.h"
#include "platform/stard/ServiceManager.h"
#include "platform/value/Uuid.h"

namespace ek {

class EkDWyreClient;

// A set of plug-ins kept out of use while a client works on them. While a hold exists the
// daemon must not exit for idleness: it keeps a service-manager transaction open from
// creation to destruction.
class EkDPlugInHold {
 public:
  static std::shared_ptr<EkDPlugInHold> initWithPlugIns(
      const std::vector<std::shared_ptr<EkDPlugIn>>& plugIns,
      const std::shared_ptr<EkDWyreClient>& client,
      std::shared_ptr<stard::ServiceManager> serviceManager);
  ~EkDPlugInHold();
  EkDPlugInHold(const EkDPlugInHold&) = delete;
  EkDPlugInHold& operator=(const EkDPlugInHold&) = delete;

  const Uuid& uuid() const { return uuid_; }
  // Membership by record identity: the plug-in's UUID.
  bool blocks(const EkDPlugIn& plugIn) const;
  const std::vector<std::shared_ptr<EkDPlugIn>>& blocked() const { return blocked_; }
  // The client that placed the hold; nullptr once its record is gone.
  std::shared_ptr<EkDWyreClient> client() const { return client_.lock(); }
  // Whether client is the very record that placed the hold (identity, not equality).
  bool placedBy(const std::shared_ptr<EkDWyreClient>& client) const;
  std::chrono::system_clock::time_point created() const { return created_; }

  bool operator==(const EkDPlugInHold& other) const { return uuid_ == other.uuid_; }

 private:
  EkDPlugInHold() = default;

  Uuid uuid_;
  std::vector<std::shared_ptr<EkDPlugIn>> blocked_;  // one per UUID
  std::weak_ptr<EkDWyreClient> client_;
  std::chrono::system_clock::time_point created_;
  std::shared_ptr<stard::ServiceManager> serviceManager_;
};

// The holds in force at one moment. The server replaces the whole list at every change, so a
// request reads one list for all its candidates without entering a queue or taking a lock.
struct EkDPlugInHolds {
  std::vector<std::shared_ptr<EkDPlugInHold>> holds;
  // Every UUID some hold blocks.
  std::unordered_set<Uuid> blocked;

  bool blocks(const EkDPlugIn& plugIn) const { return blocked.contains(plugIn.uuid()); }
};

}  // namespace ek
