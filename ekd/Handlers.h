#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/value/Value.h"

// The request handlers: for each request type, a function from the decoded request and the
// daemon's state to the reply, all named in one table. Framing, sending and encoding the reply
// are the transport's (Transaction); so are the version check and the sender's record.
namespace ek {

class EkDClientProcess;
class EkDPlugIn;
class EkDServer;
class EkDWyreClient;

// The process that wrote a request, found on first use: finding it costs a stat of the
// writer's executable (EkDWyreClient::writerOf), which the many requests that never ask about
// their caller do without. Used on the work queue only.
class RequestSender {
 public:
  // Already known.
  RequestSender(const EkDClientProcess& process) : process_(&process) {}  // NOLINT: implicit
  // Found by resolve(context) on first use.
  RequestSender(const EkDClientProcess& (*resolve)(const void*), const void* context)
      : resolve_(resolve), context_(context) {}

  const EkDClientProcess& get() const {
    if (!process_) process_ = &resolve_(context_);
    return *process_;
  }
  operator const EkDClientProcess&() const { return get(); }  // NOLINT: implicit
  const EkDClientProcess* operator->() const { return &get(); }

 private:
  mutable const EkDClientProcess* process_ = nullptr;
  const EkDClientProcess& (*resolve_)(const void*) = nullptr;
  const void* context_ = nullptr;
};

// A request as its handler sees it; valid until the reply has been sent.
struct Request {
  // The request dictionary.
  const Value& body;
  // The protocol version the request asked for (3 or 2).
  uint64_t version = 0;
  // The process that wrote the request: every question about the caller is asked of it.
  RequestSender sender;
  // The process that connected, as the logs name the client.
  pid_t pid = 0;
  // The connection's record; null for a request that came without a connection.
  std::shared_ptr<EkDWyreClient> client;
};

// A handler's answer: the members of the reply, or an error (code and message) that the reply
// carries as "errorcode" and "error", beside any members set.
struct Reply {
  struct Error {
    int32_t code = 0;
    std::string message;
  };
  Dictionary members;
  std::optional<Error> error;
  // One more member, written straight in its encoding (exactly one CBOR item), for a reply
  // too large to build as values first.
  std::string_view encodedKey;
  std::function<void(std::vector<uint8_t>& out)> writeEncoded;

  static Reply failure(int32_t code, std::string_view message);
  bool failed() const { return error.has_value(); }
};

// Sends a reply; called exactly once, from the work queue or (a hold with forced termination)
// the termination waiter.
using Respond = std::function<void(Reply)>;

// The handler of one request type, in one of two forms.
struct RequestHandler {
  // Answers at once.
  Reply (*answer)(const Request& request, EkDServer& daemon) = nullptr;
  // Answers later through respond, exactly once, unless the client has gone meanwhile: work
  // that runs in slices, or waits for another service.
  void (*start)(const Request& request, EkDServer& daemon, Respond respond) = nullptr;
};

// The handler of a request type, or nullptr when none serves it.
const RequestHandler* handlerFor(std::string_view type);

namespace handlers {

Reply findPlugIn(const Request& request, EkDServer& daemon);
Reply matchPlugIns(const Request& request, EkDServer& daemon);
Reply annotatePlugIns(const Request& request, EkDServer& daemon);
Reply bulkAnnotatePlugIns(const Request& request, EkDServer& daemon);
Reply readyPlugIns(const Request& request, EkDServer& daemon);
Reply accessPlugIns(const Request& request, EkDServer& daemon);
Reply bulkPlugIns(const Request& request, EkDServer& daemon);
// Not a plug-in request: the daemon's version, process, directories and counts.
Reply reportStatus(const Request& request, EkDServer& daemon);
void addPlugIns(const Request& request, EkDServer& daemon, Respond respond);
void removePlugIns(const Request& request, EkDServer& daemon, Respond respond);
void lockDownPlugIns(const Request& request, EkDServer& daemon, Respond respond);

// What the handlers share.

// A step of a walk: nothing to go on, else the failure that ends the walk.
using Step = std::optional<Reply>;
// Walks "uuids" (at most kMaxListEntries; "paths" as fallbacks for unknown UUIDs) and runs step
// per plug-in. Nothing when every entry was resolved and accepted, else the failure.
Step forEachListedPlugIn(const Request& request, EkDServer& daemon,
                         const std::function<Step(const std::shared_ptr<EkDPlugIn>&)>& step);
// Called per path of "paths" with the path (canonical when resolved) and whether it resolved;
// a path repeated, as sent or as resolved, is passed on once.
using PathStep = std::function<Step(const std::string& path, bool resolved)>;
// Walks "paths" (at most kMaxListEntries). Nothing when every path was accepted, else the
// failure.
Step forEachPath(const Request& request, const PathStep& step);
// The same walk for work that takes long per path (registration), answered with an empty reply
// once every path was accepted. It runs in slices of about 10 ms: after each, the daemon reads
// what waits on its sockets and the rest goes to the back of the work queue, so other clients'
// requests are answered in between. Stops unanswered once the client is gone.
void forEachPathInSlices(const Request& request, EkDServer& daemon, PathStep step, Respond respond);

}  // namespace handlers
}  // namespace ek
