#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/value/EkError.h"
#include "platform/value/Value.h"
#include "platform/wyre/Wyre.h"

namespace ek {

class EkDPlugIn;
class EkDServer;
class EkDClientProcess;
class EkDWyreClient;

// One request from arrival to reply. Made on the connection's queue, then used only on the
// work queue (or, for a hold with forced termination, on its termination waiter).
class Transaction : public std::enable_shared_from_this<Transaction> {
 public:
  // sender is the process that wrote the request; nullptr means the one that connected.
  static std::shared_ptr<Transaction> initWithRequest(
      wyre::Message request, std::shared_ptr<EkDWyreClient> client,
      std::shared_ptr<const EkDClientProcess> sender = nullptr);

  // Checks version and type and runs the request's handler, which replies exactly once.
  void dispatch();
  // Sends the reply on the client's connection (a no-op when it has gone), after running the
  // work set with beforeReply.
  void done();
  // done, with one more member of the reply under key written by writeValue straight in its
  // encoding (exactly one CBOR item), for a reply too large to build as values first.
  void doneWithEncoded(std::string_view key,
                       const std::function<void(std::vector<uint8_t>& out)>& writeValue);
  // Work that must be finished before any reply, success or failure, leaves: what the reply
  // acknowledges must be durable by then.
  void beforeReply(std::function<void()> work) { beforeReply_ = std::move(work); }
  // Sets "errorcode" and "error", then sends the reply.
  void fail(int32_t code, std::string_view message);
  // An Ekora error keeps its own code; any other error is sent with code.
  void fail(int32_t code, const EkError& error);

  enum class PathStep { Continue, Stop };
  using PathCallback = std::function<PathStep(const std::string& path, bool resolved)>;
  // Walks "paths" (at most kMaxListEntries; a path repeated is passed on once); true when
  // every path was passed on and accepted. On false a failure reply has been sent, by the walk
  // or by the callback.
  bool marshalPaths(const PathCallback& callback);
  // The same walk for work that takes long per path (registration), followed by done when
  // every path was accepted. It runs in slices of about kPathSliceBudget: after each, the rest
  // goes to the back of the work queue, so other clients' requests are answered in between.
  // Stops unanswered once the client is gone.
  void processPaths(PathCallback callback);
  static constexpr std::chrono::milliseconds kPathSliceBudget{10};

  using PlugInStep = std::function<bool(const std::shared_ptr<EkDPlugIn>& plugIn)>;
  // Walks "uuids" (with "paths" as fallbacks for unknown UUIDs) and runs step per plug-in
  // until it answers false. True when every entry was resolved and accepted; on false a
  // failure reply has been sent, by the walk or by the step.
  bool processUuidList(const PlugInStep& step);

  // The member under key when it is an array / a dictionary; nullptr otherwise.
  const Array* arrayForKey(std::string_view key) const;
  const Dictionary* dictionaryForKey(std::string_view key) const;

  const std::shared_ptr<EkDWyreClient>& client() const { return client_; }
  // The process that wrote this request: every question about the caller's program,
  // entitlements or sandbox is asked of it, never of the connection.
  const EkDClientProcess& sender() const { return *sender_; }
  const Value& request() const { return request_.body; }
  Dictionary& reply() { return reply_; }
  uint64_t version() const { return version_.load(); }
  EkDServer& server() const;
  std::shared_ptr<wyre::Connection> connection() const;

  // The request handlers, one per request type.
  void addPlugIns();
  void removePlugIns();
  void bulkPlugIns();
  void matchPlugIns();
  void readyPlugIns();
  void accessPlugIns();
  void annotatePlugIns();
  void bulkAnnotatePlugIns();
  void lockDownPlugIns();
  void findPlugIn();
  // Not a plug-in request: the daemon's version, process, directories and counts.
  void reportStatus();
  std::shared_ptr<EkDPlugIn> findPlugInByUUID(const Uuid& uuid);
  std::shared_ptr<EkDPlugIn> findPlugInByPathURL(const std::string& url);

 private:
  Transaction(wyre::Message request, std::shared_ptr<EkDWyreClient> client,
              std::shared_ptr<const EkDClientProcess> sender)
      : client_(std::move(client)), sender_(std::move(sender)), request_(std::move(request)) {}

  std::shared_ptr<EkDWyreClient> client_;
  std::shared_ptr<const EkDClientProcess> sender_;
  wyre::Message request_;
  Dictionary reply_;
  std::atomic<uint64_t> version_{0};
  bool replied_ = false;
  // Marks the transaction replied and runs the work set with beforeReply.
  void prepareReply();
  // Sends frame (kHeaderSize bytes of room, then the reply), or an error in its place when
  // it is larger than a frame may be.
  void sendFrame(std::vector<uint8_t> frame);
  // "paths" when it is an array of at most kMaxListEntries; otherwise fails and answers null.
  const Array* pathList();
  struct PathWalk;
  // One path of a walk: Continue also for a path already seen.
  PathStep walkPath(PathWalk& walk, const Value& element);
  void continuePaths(std::shared_ptr<PathWalk> walk);
  std::function<void()> beforeReply_;
};

}  // namespace ek
