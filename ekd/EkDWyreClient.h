#pragma once

#include <sys/types.h>

#include <atomic>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/codesign/CodeSigning.h"
#include "platform/wyre/Wyre.h"

namespace ek {

class EkBundle;
class EkDServer;

// The daemon's record of one connected client. It lives as long as its connection (which
// holds it as its context) and longer only while a transaction still refers to it.
class EkDWyreClient : public std::enable_shared_from_this<EkDWyreClient> {
 public:
  // Sets the record up, installs the connection's event handler and starts the connection.
  static std::shared_ptr<EkDWyreClient> initWithConnection(
      const std::shared_ptr<wyre::Connection>& connection, std::shared_ptr<EkDServer> server);

  pid_t pid() const { return pid_; }
  // The value of an entitlement in the client's code signature, or absent.
  std::optional<Value> entitlementValueForKey(std::string_view key) const;
  // Present and not equal to false (numbers by value: 0 is false).
  bool hasEntitlement(std::string_view key) const;
  bool isSandboxed() const;

  // Reactions to the connection's termination-imminent and connection-invalid events.
  void dying();
  void dead();

  std::string description() const;

  // True from creation until the client is found dead; written on the connection's queue,
  // read on the work queue.
  bool acceptWork() const { return acceptWork_.load(); }
  std::shared_ptr<wyre::Connection> connection() const { return connection_.lock(); }
  const std::shared_ptr<EkDServer>& server() const { return server_; }
  // Path of the client's executable; empty when it could not be read.
  const std::string& path() const { return path_; }
  // The bundle around the client's executable, or nullptr.
  const std::shared_ptr<EkBundle>& bundle() const { return bundle_; }
  // Changed only on the work queue.
  uint32_t requestCount() const { return requestCount_; }
  uint32_t countRequest() { return ++requestCount_; }

 private:
  EkDWyreClient() = default;
  void handleEvent(const wyre::Event& event);

  std::atomic<bool> acceptWork_{true};
  std::weak_ptr<wyre::Connection> connection_;
  std::shared_ptr<EkDServer> server_;
  std::string path_;
  std::shared_ptr<EkBundle> bundle_;
  std::shared_ptr<CodeSigningTask> task_;
  AuditToken token_;
  pid_t pid_ = 0;
  std::atomic<uint32_t> requestCount_{0};
};

}  // namespace ek
