#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Ekora/EkProtocol.h"
#include "platform/queue/SerialQueue.h"
#include "platform/value/EkError.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"
#include "platform/wyre/Wyre.h"

namespace ek {

// The client side of the daemon's protocol. Requests may be sent from any thread; replies
// arrive on the serial queue "ekd_client", in the order the daemon answered.
class EkDaemonClient {
 public:
  // The raw reply dictionary, or the transport's error when no reply arrived.
  using Reply = std::function<void(Result<Value>)>;

  // One plug-in named by UUID with an optional bundle path to fall back on.
  struct PlugInRef {
    Uuid uuid;
    std::optional<std::string> path;
  };

  // Connects to the named service, or to the daemon's when none is given. A connection that
  // cannot be made is reported to each request's callback as a transport error.
  static std::shared_ptr<EkDaemonClient> initWithServiceName(
      std::optional<std::string> serviceName = std::nullopt);

  void addPlugIns(const std::vector<std::string>& paths, Reply reply);
  void removePlugIns(const std::vector<std::string>& paths, Reply reply);
  void bulkPlugins(uint64_t flags, Reply reply);
  void readyPlugIns(const std::vector<PlugInRef>& plugIns, uint64_t flags,
                    const std::optional<Dictionary>& environment, Reply reply);
  void accessPlugIns(const std::vector<PlugInRef>& plugIns, uint64_t flags, Reply reply);
  void findPlugInByUUID(const Uuid& uuid, Reply reply);
  void findPlugInByPathURL(const std::string& url, Reply reply);
  void matchPlugIns(const Dictionary& rules, uint64_t flags, Reply reply);
  void setPluginAnnotations(const std::vector<Uuid>& uuids, const Dictionary& annotations,
                            Reply reply);
  void bulkSetPluginAnnotations(const Dictionary& annotations, Reply reply);
  void holdPlugins(const std::vector<std::string>& paths, uint64_t flags, Reply reply);
  void releaseHold(const Uuid& hold, Reply reply);

  // Building blocks.
  Dictionary request(std::string_view type) const;
  Dictionary request(std::string_view type, const std::vector<std::string>& paths) const;
  static void set(Dictionary& message, const std::vector<PlugInRef>& plugIns);
  static void set(Dictionary& message, const std::vector<Uuid>& uuids);
  void send(Dictionary message, Reply reply);

  // The error a reply carries, or nothing on success.
  static std::optional<EkError> errorInReply(const Result<Value>& reply);
  // The property-list conversion of "matches", defined for protocol version 3 only. Takes the
  // object by value: a match of hundreds of forms is moved into the reply, not copied.
  static std::optional<Value> convertToWyre(Value object, uint64_t version);
  // Whether convertToWyre converts for version: a reply to any other version has no "matches".
  static bool convertsToWyre(uint64_t version) { return version == protocol::kCurrentVersion; }
  std::optional<Value> convertFromWyre(const Value& value) const;

  int64_t protocolVersion() const { return protocolVersion_.load(); }
  void setProtocolVersion(int64_t version) { protocolVersion_ = version; }
  const std::shared_ptr<SerialQueue>& replyQueue() const { return replyQueue_; }

 private:
  EkDaemonClient() = default;

  std::shared_ptr<wyre::Connection> ekd_;
  std::optional<EkError> connectError_;
  std::shared_ptr<SerialQueue> replyQueue_;
  std::atomic<int64_t> protocolVersion_{3};
};

}  // namespace ek
