#pragma once

#include <sys/types.h>

#include <atomic>
#include <deque>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/codesign/CodeSigning.h"
#include "platform/sandbox/SandboxCheck.h"
#include "platform/wyre/Wyre.h"

namespace ek {

class EkBundle;
class EkDServer;
class Transaction;

// What the daemon knows of one process that writes requests: the program it runs, the bundle
// around that program, its entitlements and whether it runs in a sandbox. A request is judged
// by the record of the process that wrote it, which need not be the one that connected (a
// child that kept the socket, say). Immutable; the sandbox state is asked of the process
// itself, pinned by its pidfd.
class EkDClientProcess {
 public:
  // Reads the record of the process behind token, which runs the file executable. A process
  // that exits or executes another program while it is read gets the record of an unknown
  // process: no path, no bundle, no entitlements, sandboxed.
  static std::shared_ptr<const EkDClientProcess> read(AuditToken token,
                                                      std::optional<FileId> executable,
                                                      CodeSigning& codeSigning,
                                                      std::shared_ptr<SandboxCheck> sandbox);

  pid_t pid() const { return token_.pid; }
  const AuditToken& token() const { return token_; }
  // Path of the executable; empty when it could not be read.
  const std::string& path() const { return path_; }
  // The bundle around the executable, or nullptr.
  const std::shared_ptr<EkBundle>& bundle() const { return bundle_; }
  const std::optional<FileId>& executable() const { return executable_; }
  // The value of an entitlement in the program's code signature, or absent.
  std::optional<Value> entitlementValueForKey(std::string_view key) const;
  // Held when present and not boolean false (entitlementHeld).
  bool hasEntitlement(std::string_view key) const;
  bool isSandboxed() const;

 private:
  EkDClientProcess() = default;

  AuditToken token_;
  std::string path_;
  std::shared_ptr<EkBundle> bundle_;
  std::shared_ptr<CodeSigningTask> task_;
  std::optional<FileId> executable_;
  std::shared_ptr<SandboxCheck> sandbox_;
  bool unknown_ = false;
};

// The daemon's record of one connected client. It lives as long as its connection (which
// holds it as its context) and longer only while a transaction still refers to it.
class EkDWyreClient : public std::enable_shared_from_this<EkDWyreClient> {
 public:
  // Sets the record up, installs the connection's event handler and starts the connection.
  static std::shared_ptr<EkDWyreClient> initWithConnection(
      const std::shared_ptr<wyre::Connection>& connection, std::shared_ptr<EkDServer> server);

  // The process that connected. Requests are judged by their writer instead: see
  // Transaction::sender().
  pid_t pid() const { return pid_; }
  // The record of the process that connected, as read at connect.
  const std::shared_ptr<const EkDClientProcess>& process() const { return process_; }
  // The record of the process that wrote a message on this connection: kept per process and
  // executable, read anew when the process has executed another program. Costs one stat of
  // /proc/<pid>/exe per read of the socket (the messages of one read share it), made after the
  // read. Called on the work queue, in the order the messages arrived, and only for requests
  // that ask about their writer.
  std::shared_ptr<const EkDClientProcess> writerOf(const wyre::Message& message);

  // Reactions to the connection's termination-imminent and connection-invalid events.
  void dying();
  void dead();

  std::string description() const;

  // True from creation until the client is found dead; written on the connection's queue,
  // read on the work queue.
  bool acceptWork() const { return acceptWork_.load(); }
  std::shared_ptr<wyre::Connection> connection() const { return connection_.lock(); }
  const std::shared_ptr<EkDServer>& server() const { return server_; }
  // Changed only on the work queue.
  uint32_t requestCount() const { return requestCount_; }
  uint32_t countRequest() { return ++requestCount_; }

 private:
  EkDWyreClient() = default;
  void handleEvent(const wyre::Event& event);
  std::shared_ptr<const EkDClientProcess> resolveWriter(const Credentials& writer);
  void submit(std::shared_ptr<Transaction> transaction);
  void runNext();

  std::atomic<bool> acceptWork_{true};
  std::weak_ptr<wyre::Connection> connection_;
  std::shared_ptr<EkDServer> server_;
  std::shared_ptr<const EkDClientProcess> process_;
  pid_t pid_ = 0;
  std::atomic<uint32_t> requestCount_{0};

  // Writers seen on the connection, the connecting process first; on the work queue.
  std::vector<std::shared_ptr<const EkDClientProcess>> writers_;
  // The writer of the last message and the read it came in.
  std::shared_ptr<const EkDClientProcess> lastWriter_;
  uint64_t lastRead_ = 0;

  // Requests waiting for the work queue. The client has at most one turn queued there, so
  // that a client with many requests waiting delays another client's by one request, not by
  // all of its own.
  std::mutex queueMutex_;
  std::deque<std::shared_ptr<Transaction>> queued_;  // guarded by queueMutex_
  bool scheduled_ = false;                           // guarded by queueMutex_
};

}  // namespace ek
