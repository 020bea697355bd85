#include "platform/wyre/Wyre.h"

#include <fmt/format.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>
#include <asio/bind_executor.hpp>
#include <asio/dispatch.hpp>
#include <asio/post.hpp>
#include <asio/read.hpp>
#include <asio/write.hpp>

#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <future>
#include <mutex>
#include <stdexcept>
#include <thread>

#include "platform/cbor/Cbor.h"
#include "platform/log/Log.h"
#include "platform/paths/Directories.h"

namespace ek::wyre {
namespace {

using asio::local::stream_protocol;

constexpr size_t kReadChunk = 64 * 1024;
// Free space below this grows (or compacts) the input buffer before the next read; the
// buffer only grows with bytes actually received, never with a header's promise.
constexpr size_t kMinReadSpace = 16 * 1024;
// Frames gathered into one write call.
constexpr size_t kMaxGather = 64;

void putU32(uint8_t* p, uint32_t v) {
  p[0] = v >> 24;
  p[1] = v >> 16;
  p[2] = v >> 8;
  p[3] = v;
}

uint32_t getU32(const uint8_t* p) {
  return uint32_t{p[0]} << 24 | uint32_t{p[1]} << 16 | uint32_t{p[2]} << 8 | uint32_t{p[3]};
}

}  // namespace

namespace {

// Threads still inside the I/O context's run loop.
std::mutex gRunningMutex;
std::condition_variable gRunningChanged;
int gRunning = 0;

// Counts a thread out only once its thread-local objects are gone: made first in the thread,
// it is destroyed last. Counted out earlier, the process could exit while the thread still
// frees them (a leak checker then sees memory that only that thread refers to).
struct RunningMark {
  ~RunningMark() {
    std::lock_guard lock(gRunningMutex);
    --gRunning;
    gRunningChanged.notify_all();
  }
};

void runIo(asio::io_context& context) {
  thread_local RunningMark mark;
  context.run();
}

// At exit the I/O threads stop before static objects go: a socket failing during exit would
// otherwise compare its error code against error categories already destroyed.
void stopIoAtExit() {
  asio::io_context& context = ioContext();
  context.stop();
  std::unique_lock lock(gRunningMutex);
  // Bounded: exit called from an I/O thread itself, or a handler that never returns, must not
  // keep the process from ending.
  gRunningChanged.wait_for(lock, std::chrono::seconds(2), [] { return gRunning == 0; });
}

}  // namespace

asio::io_context& ioContext() {
  // Never destroyed: sockets may still be served while the process exits.
  static asio::io_context* context = new asio::io_context(2);
  static auto* work = [] {
    auto* guard =
        new asio::executor_work_guard<asio::io_context::executor_type>(context->get_executor());
    // The categories error codes compare against, made now so that they are destroyed only
    // after stopIoAtExit has run (exit runs handlers and destructors in reverse order).
    (void)asio::error::get_misc_category();
    (void)asio::error::get_netdb_category();
    (void)asio::error::get_addrinfo_category();
    (void)asio::system_category();
    {
      std::lock_guard lock(gRunningMutex);
      gRunning = 2;
    }
    std::thread([] { runIo(*context); }).detach();
    std::thread([] { runIo(*context); }).detach();
    std::atexit(stopIoAtExit);
    return guard;
  }();
  (void)work;
  return *context;
}

EkError connectionInvalidError() {
  return {std::string(kErrorDomain), kConnectionInvalid, "Connection invalid"};
}

EkError terminationImminentError() {
  return {std::string(kErrorDomain), kTerminationImminent, "Connection termination imminent"};
}

void encodeHeader(const FrameHeader& header, uint8_t* out) {
  putU32(out, header.length);
  putU32(out + 4, header.flags);
  putU32(out + 8, static_cast<uint32_t>(header.id >> 32));
  putU32(out + 12, static_cast<uint32_t>(header.id));
}

FrameHeader decodeHeader(const uint8_t* in) {
  return {getU32(in), getU32(in + 4), uint64_t{getU32(in + 8)} << 32 | getU32(in + 12)};
}

void appendFrame(std::vector<uint8_t>& out, const Value& body, uint32_t flags, uint64_t id) {
  size_t start = out.size();
  out.resize(start + kHeaderSize);
  cbor::encode(body, out);
  FrameHeader header{static_cast<uint32_t>(out.size() - start - kHeaderSize), flags, id};
  encodeHeader(header, out.data() + start);
}

bool isValidServiceName(std::string_view name) {
  if (name.empty() || name.size() > 96 || name[0] == '.') return false;
  for (char c : name) {
    bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
              c == '.' || c == '-' || c == '_';
    if (!ok) return false;
  }
  return true;
}

// ---------------------------------------------------------------------------------------------
// Connection

Connection::Connection(stream_protocol::socket socket, AuditToken token,
                       std::shared_ptr<SerialQueue> deliveryQueue)
    : socket_(std::move(socket)),
      strand_(asio::make_strand(socket_.get_executor())),
      token_(std::move(token)),
      deliveryQueue_(std::move(deliveryQueue)) {}

Connection::~Connection() = default;

Result<std::shared_ptr<Connection>> Connection::connect(std::string_view serviceName,
                                                        std::shared_ptr<SerialQueue> deliveryQueue,
                                                        asio::io_context& context) {
  if (!isValidServiceName(serviceName)) {
    return EkError::posix(EINVAL, fmt::format("invalid service name \"{}\"", serviceName));
  }
  std::string path = paths::servicePath(serviceName);
  stream_protocol::socket socket(context);
  asio::error_code ec;
  socket.connect(stream_protocol::endpoint(path), ec);
  if (ec) return EkError::posix(ec.value(), fmt::format("{}: {}", path, ec.message()));
  auto token = AuditToken::forSocket(socket.native_handle());
  if (!token) return EkError::fromErrno(errno, "reading the peer's credentials");
  return std::shared_ptr<Connection>(
      new Connection(std::move(socket), std::move(*token), std::move(deliveryQueue)));
}

std::shared_ptr<Connection> Connection::adopt(stream_protocol::socket socket, AuditToken token) {
  return std::shared_ptr<Connection>(new Connection(std::move(socket), std::move(token), nullptr));
}

void Connection::setEventHandler(EventHandler handler) {
  asio::dispatch(strand_, [self = shared_from_this(), handler = std::move(handler)]() mutable {
    self->handler_ = std::move(handler);
  });
}

void Connection::resume() {
  asio::dispatch(strand_, [self = shared_from_this()] {
    if (self->resumed_ || self->closed_) return;
    self->resumed_ = true;
    self->keepAlive_ = self;
    self->readMore();
  });
}

void Connection::cancel() {
  asio::dispatch(strand_, [self = shared_from_this()] { self->fail(); });
}

void Connection::readMore() {
  if (reading_ || closed_ || unanswered_.load() >= kMaxUnansweredRequests) return;
  if (inputStart_ == inputEnd_) {
    inputStart_ = inputEnd_ = 0;
  }
  if (input_.size() - inputEnd_ < kMinReadSpace) {
    if (inputStart_ > 0) {
      std::memmove(input_.data(), input_.data() + inputStart_, inputEnd_ - inputStart_);
      inputEnd_ -= inputStart_;
      inputStart_ = 0;
    }
    if (input_.size() - inputEnd_ < kMinReadSpace) {
      input_.resize(std::max(input_.size() * 2, kReadChunk));
    }
  }
  reading_ = true;
  socket_.async_read_some(asio::buffer(input_.data() + inputEnd_, input_.size() - inputEnd_),
                          asio::bind_executor(strand_, [self = shared_from_this()](
                                                           const asio::error_code& ec, size_t n) {
                            self->reading_ = false;
                            if (ec || self->closed_) {
                              self->fail();
                              return;
                            }
                            self->inputEnd_ += n;
                            self->parseInput();
                            self->readMore();
                          }));
}

void Connection::parseInput() {
  while (!closed_ && unanswered_.load() < kMaxUnansweredRequests) {
    size_t available = inputEnd_ - inputStart_;
    if (available < kHeaderSize) return;
    FrameHeader header = decodeHeader(input_.data() + inputStart_);
    if (header.length > kMaxBodySize) {
      log::process().error("closing connection from pid=%d: frame of %u bytes", pid(),
                           header.length);
      fail();
      return;
    }
    if (available < kHeaderSize + header.length) return;
    auto body = cbor::decode(std::span(input_.data() + inputStart_ + kHeaderSize, header.length));
    inputStart_ += kHeaderSize + header.length;
    if (!body) {
      log::process().error("closing connection from pid=%d: %s", pid(), body.error().message);
      fail();
      return;
    }
    if (header.flags & kFlagReply) {
      ReplyHandler handler;
      {
        std::lock_guard lock(pendingMutex_);
        auto it = pending_.find(header.id);
        if (it != pending_.end()) {
          handler = std::move(it->second);
          pending_.erase(it);
        }
      }
      if (handler) deliverReply(std::move(handler), std::move(body).value());
      continue;
    }
    Event event;
    event.type = EventType::Message;
    event.message = Message{std::move(body).value(), header.id, header.flags};
    if (event.message.wantsReply()) unanswered_.fetch_add(1);
    deliver(std::move(event));
  }
}

void Connection::deliver(Event event) {
  if (!handler_) return;
  if (deliveryQueue_) {
    deliveryQueue_->async([handler = handler_, event = std::move(event)] { handler(event); });
  } else {
    handler_(event);
  }
}

void Connection::deliverReply(ReplyHandler handler, Result<Value> result) {
  if (deliveryQueue_) {
    deliveryQueue_->async([handler = std::move(handler), result = std::move(result)]() mutable {
      handler(std::move(result));
    });
  } else {
    handler(std::move(result));
  }
}

void Connection::fail() {
  {
    std::lock_guard lock(outputMutex_);
    if (closed_) return;
    closed_ = true;
    asio::error_code ignored;
    socket_.shutdown(stream_protocol::socket::shutdown_both, ignored);
    socket_.close(ignored);
    // A write in flight still refers to the queued frames; its completion drops them.
    if (!writing_) {
      output_.clear();
      queuedBytes_ = 0;
    }
  }
  std::map<uint64_t, ReplyHandler> pending;
  {
    std::lock_guard lock(pendingMutex_);
    pending.swap(pending_);
  }
  for (auto& [id, handler] : pending) deliverReply(std::move(handler), connectionInvalidError());
  Event event;
  event.type = EventType::Error;
  event.error = connectionInvalidError();
  deliver(std::move(event));
  // Nothing more will be delivered; dropping the handler breaks cycles through its captures.
  handler_ = nullptr;
  keepAlive_.reset();
}

void Connection::releaseUnanswered() {
  size_t before = unanswered_.load();
  while (before > 0 && !unanswered_.compare_exchange_weak(before, before - 1)) {
  }
  if (before == kMaxUnansweredRequests) {
    asio::post(strand_, [self = shared_from_this()] {
      self->parseInput();
      self->readMore();
    });
  }
}

void Connection::enqueueOutput(std::vector<uint8_t> frame, bool answersRequest) {
  if (answersRequest) releaseUnanswered();
  if (frame.empty()) return;
  bool failNow = false;
  bool startWriter = false;
  {
    std::lock_guard lock(outputMutex_);
    if (closed_) return;
    size_t sent = 0;
    if (output_.empty() && !writing_) {
      // Nothing queued: write straight from this thread, saving a hop to the I/O thread.
      ssize_t n =
          ::send(socket_.native_handle(), frame.data(), frame.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
      if (n == static_cast<ssize_t>(frame.size())) return;
      if (n < 0 && errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR) {
        failNow = true;
      } else if (n > 0) {
        sent = static_cast<size_t>(n);
      }
    }
    // One frame of any size a frame may have is always taken: a large answer is not a peer
    // that fails to read. What piles up behind it is bounded.
    if (!failNow && queuedBytes_ > 0 && queuedBytes_ + frame.size() > kMaxQueuedOutput) {
      log::process().error("closing connection from pid=%d: it does not read its replies", pid());
      failNow = true;
    }
    if (!failNow) {
      queuedBytes_ += frame.size() - sent;
      // Only a frame that starts an empty queue can have been partly sent.
      if (output_.empty()) outputStart_ = sent;
      output_.push_back(std::move(frame));
      if (!writing_) writing_ = startWriter = true;
    }
  }
  if (failNow) {
    // Posted, never run inline: the sender may be inside this connection's event handler.
    asio::post(strand_, [self = shared_from_this()] { self->fail(); });
  } else if (startWriter) {
    asio::post(strand_, [self = shared_from_this()] { self->writeMore(); });
  }
}

void Connection::writeMore() {
  std::vector<asio::const_buffer> buffers;
  {
    std::lock_guard lock(outputMutex_);
    if (closed_ || output_.empty()) {
      output_.clear();
      outputStart_ = 0;
      queuedBytes_ = 0;
      writing_ = false;
      return;
    }
    size_t count = std::min(output_.size(), kMaxGather);
    buffers.reserve(count);
    for (size_t i = 0; i < count; ++i) buffers.emplace_back(asio::buffer(output_[i]));
    buffers.front() += outputStart_;
  }
  size_t count = buffers.size();
  asio::async_write(socket_, buffers,
                    asio::bind_executor(strand_, [self = shared_from_this(), count](
                                                     const asio::error_code& ec, size_t written) {
                      {
                        std::lock_guard lock(self->outputMutex_);
                        for (size_t i = 0; i < count && !self->output_.empty(); ++i) {
                          self->output_.pop_front();
                        }
                        self->outputStart_ = 0;
                        self->queuedBytes_ -= std::min(written, self->queuedBytes_);
                      }
                      if (ec) {
                        self->fail();
                      }
                      self->writeMore();
                    }));
}

size_t Connection::queuedOutputBytes() const {
  std::lock_guard lock(outputMutex_);
  return queuedBytes_;
}

void Connection::send(const Value& message) {
  std::vector<uint8_t> frame;
  appendFrame(frame, message, 0, nextId_.fetch_add(1));
  enqueueOutput(std::move(frame), false);
}

void Connection::sendWithReply(const Value& message, ReplyHandler handler) {
  uint64_t id = nextId_.fetch_add(1);
  std::vector<uint8_t> frame;
  appendFrame(frame, message, kFlagWantsReply, id);
  {
    std::lock_guard lock(pendingMutex_);
    if (!closed_) {
      pending_.emplace(id, std::move(handler));
      handler = nullptr;
    }
  }
  if (handler) {
    deliverReply(std::move(handler), connectionInvalidError());
    return;
  }
  enqueueOutput(std::move(frame), false);
}

void Connection::reply(const Message& request, const Value& reply) {
  if (!request.wantsReply()) return;
  std::vector<uint8_t> frame;
  appendFrame(frame, reply, kFlagReply, request.id);
  enqueueOutput(std::move(frame), true);
}

void Connection::replyEncoded(const Message& request, std::vector<uint8_t> frame) {
  if (!request.wantsReply()) return;
  if (frame.size() < kHeaderSize) throw std::logic_error("reply frame without its header");
  encodeHeader({static_cast<uint32_t>(frame.size() - kHeaderSize), kFlagReply, request.id},
               frame.data());
  enqueueOutput(std::move(frame), true);
}

void Connection::dropRequest(const Message& request) {
  if (!request.wantsReply()) return;
  enqueueOutput({}, true);
}

std::string Connection::description() const {
  return fmt::format("<wyre connection {} pid={}{}>", static_cast<const void*>(this), pid(),
                     closed_ ? " closed" : "");
}

// ---------------------------------------------------------------------------------------------
// Listener

Listener::Listener(asio::io_context& context, std::shared_ptr<SerialQueue> queue)
    : acceptor_(context), strand_(asio::make_strand(context)), queue_(std::move(queue)) {}

Listener::~Listener() = default;

Result<std::shared_ptr<Listener>> Listener::create(std::string_view serviceName,
                                                   std::shared_ptr<SerialQueue> queue,
                                                   asio::io_context& context) {
  if (!isValidServiceName(serviceName)) {
    return EkError::posix(EINVAL, fmt::format("invalid service name \"{}\"", serviceName));
  }
  auto listener = std::shared_ptr<Listener>(new Listener(context, std::move(queue)));
  listener->path_ = paths::servicePath(serviceName);
  asio::error_code ec;

  // Socket activation: adopt the first passed socket that is a listening Unix stream socket.
  int passed = sd_listen_fds(1);
  for (int i = 0; i < passed; ++i) {
    int fd = SD_LISTEN_FDS_START + i;
    if (sd_is_socket_unix(fd, SOCK_STREAM, 1, nullptr, 0) > 0) {
      listener->acceptor_.assign(stream_protocol(), fd, ec);
      if (ec) return EkError::posix(ec.value(), "adopting the activation socket: " + ec.message());
      listener->activated_ = true;
      return listener;
    }
  }

  EK_TRY(paths::ensureDirectory(paths::runtimeDir()));
  const std::string& path = listener->path_;
  if (path.size() >= sizeof(sockaddr_un::sun_path)) {
    return EkError::posix(ENAMETOOLONG, fmt::format("socket path too long: {}", path));
  }
  struct stat st;
  if (lstat(path.c_str(), &st) == 0) {
    if (!S_ISSOCK(st.st_mode)) {
      return EkError::posix(EEXIST, fmt::format("{} exists and is not a socket", path));
    }
    stream_protocol::socket probe(context);
    probe.connect(stream_protocol::endpoint(path), ec);
    if (!ec) return EkError::posix(EADDRINUSE, fmt::format("another process listens on {}", path));
    ::unlink(path.c_str());
  }
  auto& acceptor = listener->acceptor_;
  acceptor.open(stream_protocol(), ec);
  if (!ec) acceptor.bind(stream_protocol::endpoint(path), ec);
  if (!ec) ::chmod(path.c_str(), 0666);
  if (!ec) acceptor.listen(SOMAXCONN, ec);
  if (ec) return EkError::posix(ec.value(), fmt::format("listening on {}: {}", path, ec.message()));
  return listener;
}

void Listener::setEventHandler(EventHandler handler) {
  asio::dispatch(strand_, [self = shared_from_this(), handler = std::move(handler)]() mutable {
    self->handler_ = std::move(handler);
  });
}

void Listener::resume() {
  asio::dispatch(strand_, [self = shared_from_this()] { self->acceptMore(); });
}

void Listener::acceptMore() {
  if (cancelled_) return;
  acceptor_.async_accept(asio::bind_executor(
      strand_,
      [self = shared_from_this()](const asio::error_code& ec, stream_protocol::socket socket) {
        if (self->cancelled_) return;
        if (ec) {
          if (ec == asio::error::operation_aborted) return;
          EkError error{std::string(kErrorDomain), ec.value(), ec.message()};
          if (self->handler_) {
            self->queue_->async([handler = self->handler_, error] { handler({nullptr, error}); });
          }
          // Out of descriptors and the like: back off a little instead of spinning.
          auto timer = std::make_shared<asio::steady_timer>(self->strand_);
          timer->expires_after(std::chrono::milliseconds(50));
          timer->async_wait([self, timer](const asio::error_code&) { self->acceptMore(); });
          return;
        }
        auto token = AuditToken::forSocket(socket.native_handle());
        if (token && self->handler_) {
          auto connection = Connection::adopt(std::move(socket), std::move(*token));
          self->queue_->async([handler = self->handler_, connection] {
            handler({connection, std::nullopt});
          });
        }
        self->acceptMore();
      }));
}

void Listener::cancel() {
  auto done = std::make_shared<std::promise<void>>();
  auto finished = done->get_future();
  asio::dispatch(strand_, [self = shared_from_this(), done] {
    if (!self->cancelled_.exchange(true)) {
      asio::error_code ignored;
      self->acceptor_.close(ignored);
      if (!self->activated_) ::unlink(self->path_.c_str());
      if (self->handler_) {
        self->queue_->async([handler = self->handler_] {
          handler({nullptr, connectionInvalidError()});
        });
      }
    }
    done->set_value();
  });
  // Once cancel returns nobody can connect any more, so the caller may exit at once.
  if (!strand_.running_in_this_thread()) finished.wait();
}

}  // namespace ek::wyre
