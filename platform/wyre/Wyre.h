#pragma once

#include <asio/any_io_executor.hpp>
#include <asio/io_context.hpp>
#include <asio/local/stream_protocol.hpp>
#include <asio/steady_timer.hpp>
#include <asio/strand.hpp>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/process/Process.h"
#include "platform/queue/SerialQueue.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

// Wyre: message IPC over Unix stream sockets. Each message travels in one frame: a 16-byte
// big-endian header (body length, flags, message id) and one CBOR data item.
namespace ek::wyre {

inline constexpr size_t kHeaderSize = 16;
inline constexpr uint32_t kMaxBodySize = 64u << 20;
inline constexpr uint32_t kFlagWantsReply = 1u << 0;
inline constexpr uint32_t kFlagReply = 1u << 1;
// Replies a peer has not read yet beyond this close its connection; a single frame larger than
// this is still sent, within kMaxQueuedOutputTotal.
inline constexpr size_t kMaxQueuedOutput = 8u << 20;
// A message waits for the receiver from its arrival until its handler has finished (reply sent
// or request dropped), whether or not it wants a reply. A connection stops reading while this
// many of its messages, or kMaxWaitingBytes of them (one message of any size is taken), wait.
inline constexpr size_t kMaxWaitingMessages = 256;
inline constexpr size_t kMaxWaitingBytes = 16u << 20;
// A frame whose body has not all arrived this long after its first bytes closes the connection.
inline constexpr std::chrono::seconds kFrameDeadline{10};
// Bounds across every connection of the process. Input held (parts of frames not yet whole,
// and messages waiting for the receiver, by their encoded size) past this pauses reading on
// every connection until some is freed; each connection may overshoot it by one read (64 KiB).
inline constexpr size_t kMaxHeldInputTotal = 256u << 20;
// Output queued for peers past this closes the connection whose reply would exceed it, even
// for the one frame a connection is always allowed.
inline constexpr size_t kMaxQueuedOutputTotal = 256u << 20;
// A listener serves at most this many connections at once; one more is closed at accept. Fewer
// when the descriptor limit could not hold this many (see Listener::connectionLimit).
inline constexpr size_t kMaxConnections = 4096;

// The context that runs every socket of the process on two threads of its own, so that a
// connection's reads, parsing and event delivery never wait for a pool thread to be woken,
// and two cores can make system calls at once under load.
asio::io_context& ioContext();

inline constexpr std::string_view kErrorDomain = "Wyre";
inline constexpr int32_t kConnectionInvalid = 1;
inline constexpr int32_t kTerminationImminent = 2;
EkError connectionInvalidError();
EkError terminationImminentError();

struct FrameHeader {
  uint32_t length = 0;
  uint32_t flags = 0;
  uint64_t id = 0;
};
void encodeHeader(const FrameHeader& header, uint8_t* out);
FrameHeader decodeHeader(const uint8_t* in);
// Appends one whole frame carrying body to out.
void appendFrame(std::vector<uint8_t>& out, const Value& body, uint32_t flags, uint64_t id);

// A service name must be usable as one file name in the runtime directory.
bool isValidServiceName(std::string_view name);

// A message's place among those waiting for the receiver (kMaxWaitingMessages). Freed once:
// by Connection::reply / replyEncoded / dropRequest, or when the last copy of the message goes.
class WaitingTicket {
 public:
  WaitingTicket(std::weak_ptr<class Connection> connection, size_t bytes)
      : connection_(std::move(connection)), bytes_(bytes) {}
  WaitingTicket(const WaitingTicket&) = delete;
  WaitingTicket& operator=(const WaitingTicket&) = delete;
  ~WaitingTicket() { release(); }
  void release();

 private:
  std::weak_ptr<class Connection> connection_;
  size_t bytes_;
  std::atomic<bool> released_{false};
};

struct Message {
  Value body;
  uint64_t id = 0;
  uint32_t flags = 0;
  // The process that wrote the frame, as the kernel stamped its bytes; on a connection the
  // process made itself, the peer's credentials.
  Credentials sender;
  // Which read of the connection completed the frame (counting from 1): messages of one read
  // were all written by one process, and the read came after all of them were written.
  uint64_t read = 0;
  std::shared_ptr<WaitingTicket> ticket;
  bool wantsReply() const { return flags & kFlagWantsReply; }
};

// Bytes held across every connection of the process (see kMaxHeldInputTotal and
// kMaxQueuedOutputTotal).
size_t heldInputBytesTotal();
size_t queuedOutputBytesTotal();

enum class EventType { Message, Error };

// What a connection delivers to its handler: a message, or an error (connection-invalid when
// the peer closed or the connection failed; termination-imminent is never raised by sockets).
struct Event {
  EventType type = EventType::Message;
  Message message;
  EkError error;

  bool isConnectionInvalid() const {
    return type == EventType::Error && error.code == kConnectionInvalid;
  }
};

class Connection : public std::enable_shared_from_this<Connection> {
 public:
  using EventHandler = std::function<void(const Event&)>;
  // Receives the reply, or connection-invalid when the connection ends first.
  using ReplyHandler = std::function<void(Result<Value>)>;

  // Connects to the service named name. Events and replies are delivered on deliveryQueue
  // when one is given, else on the connection's own event queue.
  static Result<std::shared_ptr<Connection>> connect(
      std::string_view serviceName, std::shared_ptr<SerialQueue> deliveryQueue = nullptr,
      asio::io_context& context = ioContext());
  // Adopts an accepted socket (the listener's side): passes credentials on it, and stamps
  // every message with the process that wrote it. A frame written by more than one process,
  // or a writer whose uid is neither this process's nor 0, closes the connection. slot is
  // held until the connection closes (the listener counts connections with it).
  static std::shared_ptr<Connection> adopt(asio::local::stream_protocol::socket socket,
                                           AuditToken token, std::shared_ptr<void> slot = nullptr);
  ~Connection();

  // Set before resume; events arrive in order, one at a time.
  void setEventHandler(EventHandler handler);
  void resume();
  // Closes the connection; the handler then receives connection-invalid once.
  void cancel();

  // Thread-safe sends. The body is encoded on the caller's thread.
  void send(const Value& message);
  void sendWithReply(const Value& message, ReplyHandler handler);
  // Answers a request received on this connection. A request that wanted no reply, or a
  // connection that has ended, makes this a no-op.
  void reply(const Message& request, const Value& reply);
  // The same with the reply already encoded: frame holds kHeaderSize bytes of room for the
  // header, then the reply's CBOR.
  void replyEncoded(const Message& request, std::vector<uint8_t> frame);
  // The receiver is done with this message without answering it: frees its place among the
  // waiting.
  void dropRequest(const Message& request);

  const AuditToken& auditToken() const { return token_; }
  pid_t pid() const { return token_.pid; }
  // Kept alive until the connection itself is freed (its finalizer drops it).
  void setContext(std::shared_ptr<void> context) { context_ = std::move(context); }
  std::string description() const;
  bool isValid() const { return !closed_.load(); }

  // Bytes of encoded output not yet written to the socket.
  size_t queuedOutputBytes() const;

 private:
  friend class WaitingTicket;
  Connection(asio::local::stream_protocol::socket socket, AuditToken token,
             std::shared_ptr<SerialQueue> deliveryQueue, bool stampsWriters);

  bool waitingFull() const;
  void readMore();
  void receive();
  bool consume(const uint8_t* data, size_t size, const Credentials& writer);
  size_t parseFrames(const uint8_t* data, size_t size, const Credentials& writer);
  bool deliverFrame(const FrameHeader& header, const uint8_t* body, const Credentials& writer);
  void holdInput(const uint8_t* data, size_t size, const Credentials& writer);
  void dropHeldInput(size_t count);
  void parseHeldInput();
  void armDeadline();
  void close(std::string_view reason);
  void enqueueOutput(std::vector<uint8_t> frame, const Message* answered);
  void releaseWaiting(size_t bytes);
  void writeMore();
  void fail();
  void deliver(Event event);
  void deliverReply(ReplyHandler handler, Result<Value> result);

  asio::local::stream_protocol::socket socket_;
  asio::strand<asio::any_io_executor> strand_;
  AuditToken token_;
  std::shared_ptr<SerialQueue> deliveryQueue_;
  std::shared_ptr<void> context_;

  const bool stampsWriters_;

  // Touched on strand_ only.
  EventHandler handler_;
  // An open connection keeps itself alive, even while no read is pending (reading pauses
  // while messages wait for the receiver); ending it drops this reference.
  std::shared_ptr<Connection> keepAlive_;
  std::shared_ptr<void> slot_;
  // Received bytes not parsed yet: a frame not yet whole, or frames read past a pause. Idle
  // connections hold none; reads go through a buffer of the reading thread.
  std::vector<uint8_t> held_;
  size_t heldStart_ = 0;
  Credentials heldWriter_;
  uint64_t heldGeneration_ = 0;  // counts the times held_ became empty
  uint64_t reads_ = 0;
  std::unique_ptr<asio::steady_timer> deadline_;
  std::unique_ptr<asio::steady_timer> retry_;
  bool reading_ = false;
  bool resumed_ = false;

  // Replies are written from the thread that makes them when nothing is queued; otherwise
  // they queue here for the writer on strand_. Closing the socket also takes this mutex, so
  // no thread writes to a descriptor number that has been reused.
  mutable std::mutex outputMutex_;
  std::deque<std::vector<uint8_t>> output_;  // guarded by outputMutex_
  // Bytes of output_.front() written already: the rest of a large reply is not moved down.
  size_t outputStart_ = 0;  // guarded by outputMutex_
  size_t queuedBytes_ = 0;  // guarded by outputMutex_
  bool writing_ = false;    // a writer owns the socket; guarded by outputMutex_

  std::atomic<size_t> waiting_{0};
  std::atomic<size_t> waitingBytes_{0};
  std::atomic<bool> resumeOnRelease_{false};
  std::atomic<bool> closed_{false};
  std::atomic<uint64_t> nextId_{1};
  std::mutex pendingMutex_;
  std::map<uint64_t, ReplyHandler> pending_;  // guarded by pendingMutex_
};

// What a listener delivers: a new connection, or an error.
struct ListenerEvent {
  std::shared_ptr<Connection> connection;
  std::optional<EkError> error;
};

class Listener : public std::enable_shared_from_this<Listener> {
 public:
  using EventHandler = std::function<void(const ListenerEvent&)>;

  // Listens on the service named name: adopts a socket passed by socket activation, else
  // binds $EKORA_RUNTIME_DIR/<name> (mode 0600), replacing a socket file left by a dead
  // process. Fails when another process listens there. Events are delivered on queue.
  // A connection whose peer uid is neither this process's effective uid nor 0 is closed at
  // accept (logged once per uid), as is one past connectionLimit(). Accept failures (out of
  // descriptors, say) are delivered as errors, at most one a second, and accepting backs off.
  static Result<std::shared_ptr<Listener>> create(std::string_view serviceName,
                                                  std::shared_ptr<SerialQueue> queue,
                                                  asio::io_context& context = ioContext());
  ~Listener();

  void setEventHandler(EventHandler handler);
  // Starts accepting. Nothing is accepted before.
  void resume();
  // Stops accepting, and returns once it has; the handler receives connection-invalid. The
  // socket file is removed unless it was passed in by socket activation.
  void cancel();

  const std::string& path() const { return path_; }
  bool activated() const { return activated_; }
  // kMaxConnections, or fewer when the descriptor limit leaves room for fewer (each
  // connection takes a socket and a pidfd, and the process keeps some for its own files).
  size_t connectionLimit() const;
  size_t connectionCount() const { return count_->load(); }

 private:
  Listener(asio::io_context& context, std::shared_ptr<SerialQueue> queue);
  void prepare();
  void acceptMore();
  void accepted(asio::local::stream_protocol::socket socket);
  void backOff(const asio::error_code& ec);

  asio::local::stream_protocol::acceptor acceptor_;
  asio::strand<asio::io_context::executor_type> strand_;
  std::shared_ptr<SerialQueue> queue_;
  EventHandler handler_;
  std::string path_;
  bool activated_ = false;
  std::atomic<bool> cancelled_{false};
  std::shared_ptr<std::atomic<size_t>> count_ = std::make_shared<std::atomic<size_t>>(0);
  std::chrono::milliseconds backoff_{0};  // on strand_
};

}  // namespace ek::wyre
