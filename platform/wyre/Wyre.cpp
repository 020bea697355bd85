#include "platform/wyre/Wyre.h"

#include <fmt/format.h>
#include <sys/resource.h>
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
#include <set>
#include <stdexcept>
#include <thread>

#include "platform/cbor/Cbor.h"
#include "platform/log/Log.h"
#include "platform/paths/Directories.h"

namespace ek::wyre {
namespace {

using asio::local::stream_protocol;

constexpr size_t kReadChunk = 64 * 1024;
// Frames gathered into one write call.
constexpr size_t kMaxGather = 64;
// Descriptors the process keeps for itself (database, bundles, log) below its limit, and what
// one connection takes: its socket, its peer's pidfd, and room for another writer's.
constexpr rlim_t kReservedDescriptors = 64;
constexpr size_t kDescriptorsPerConnection = 3;

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
  // Two threads run it, but with the hint of one the thread that took readiness events runs
  // their handlers itself instead of waking the other to wait on epoll meanwhile: that wake-up
  // and task switch cost each request more than the overlap saves, since the daemon's requests
  // run one at a time on its work queue anyway. Posted work still wakes an idle thread.
  static asio::io_context* context = new asio::io_context(1);
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

namespace {

std::atomic<size_t> gHeldInput{0};
std::atomic<size_t> gQueuedOutput{0};

void subtract(std::atomic<size_t>& counter, size_t n) {
  if (n > 0) counter.fetch_sub(n, std::memory_order_relaxed);
}

// The reading thread's buffer: every read lands here first, so that an idle connection holds
// no buffer of its own.
uint8_t* scratch() {
  thread_local std::unique_ptr<uint8_t[]> buffer(new uint8_t[kReadChunk]);
  return buffer.get();
}

// Lines about a misbehaving peer come as fast as it can misbehave: one a second is enough.
log::Throttle gClosingThrottle;
log::Throttle gPauseThrottle;

bool uidServed(uid_t uid) {
  static const uid_t own = geteuid();
  return uid == own || uid == 0;
}

}  // namespace

size_t heldInputBytesTotal() {
  return gHeldInput.load(std::memory_order_relaxed);
}

size_t queuedOutputBytesTotal() {
  return gQueuedOutput.load(std::memory_order_relaxed);
}

void WaitingTicket::release() {
  if (released_.exchange(true)) return;
  subtract(gHeldInput, bytes_);
  if (auto connection = connection_.lock()) connection->releaseWaiting(bytes_);
}

Connection::Connection(stream_protocol::socket socket, AuditToken token,
                       std::shared_ptr<SerialQueue> deliveryQueue, bool stampsWriters)
    : socket_(std::move(socket)),
      strand_(asio::make_strand(socket_.get_executor())),
      token_(std::move(token)),
      deliveryQueue_(std::move(deliveryQueue)),
      stampsWriters_(stampsWriters) {}

Connection::~Connection() {
  subtract(gHeldInput, held_.size() - heldStart_);
  subtract(gQueuedOutput, queuedBytes_);
}

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
      new Connection(std::move(socket), std::move(*token), std::move(deliveryQueue), false));
}

std::shared_ptr<Connection> Connection::adopt(stream_protocol::socket socket, AuditToken token,
                                              std::shared_ptr<void> slot) {
  int on = 1;
  ::setsockopt(socket.native_handle(), SOL_SOCKET, SO_PASSCRED, &on, sizeof on);
  auto connection = std::shared_ptr<Connection>(
      new Connection(std::move(socket), std::move(token), nullptr, true));
  connection->slot_ = std::move(slot);
  return connection;
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

bool Connection::waitingFull() const {
  size_t bytes = waitingBytes_.load();
  return waiting_.load() >= kMaxWaitingMessages || (bytes > 0 && bytes >= kMaxWaitingBytes);
}

void Connection::close(std::string_view reason) {
  log::process().throttled(gClosingThrottle, log::Level::Error,
                           "closing connection from pid=%d: %s", pid(), reason);
  fail();
}

void Connection::readMore() {
  if (reading_ || closed_) return;
  // Frames read past a pause come first, until none is whole or the waiting are full again.
  // A release may come at any moment from another thread, also between parsing stopping for
  // a full queue and the check after it: so the held frames are looked at again each time.
  for (;;) {
    if (waitingFull()) {
      // Resumed when a waiting message is released. Checked again after setting the flag:
      // the last release may have come in between.
      resumeOnRelease_ = true;
      if (waitingFull()) return;
      resumeOnRelease_ = false;
    }
    size_t held = held_.size() - heldStart_;
    if (heldStart_ >= held_.size() || held < kHeaderSize) break;
    FrameHeader header = decodeHeader(held_.data() + heldStart_);
    // One too large is refused by the parse.
    if (header.length <= kMaxBodySize && held < kHeaderSize + header.length) break;
    parseHeldInput();
    if (closed_) return;
  }
  if (gHeldInput.load(std::memory_order_relaxed) >= kMaxHeldInputTotal) {
    log::process().throttled(gPauseThrottle, log::Level::Error,
                             "pausing input: %zu bytes held for all connections",
                             gHeldInput.load());
    if (!retry_) retry_ = std::make_unique<asio::steady_timer>(strand_);
    reading_ = true;
    retry_->expires_after(std::chrono::milliseconds(20));
    retry_->async_wait([self = shared_from_this()](const asio::error_code&) {
      self->reading_ = false;
      self->readMore();
    });
    return;
  }
  reading_ = true;
  socket_.async_wait(
      stream_protocol::socket::wait_read,
      asio::bind_executor(strand_, [self = shared_from_this()](const asio::error_code& ec) {
        self->reading_ = false;
        if (ec || self->closed_) {
          self->fail();
          return;
        }
        self->receive();
      }));
}

void Connection::receive() {
  uint8_t* buffer = scratch();
  // A few reads per wake-up, then the others' turn.
  for (int reads = 0; reads < 16; ++reads) {
    if (closed_ || waitingFull()) break;
    iovec vector{buffer, kReadChunk};
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(ucred))];
    msghdr message{};
    message.msg_iov = &vector;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    ssize_t n = ::recvmsg(socket_.native_handle(), &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
    if (n < 0) {
      if (errno == EINTR) continue;
      if (errno == EAGAIN || errno == EWOULDBLOCK) break;
      fail();
      return;
    }
    if (n == 0) {
      fail();
      return;
    }
    if (message.msg_flags & MSG_CTRUNC) {
      // Descriptors passed to us: the kernel has closed them, and we want none.
      close("it passes descriptors");
      return;
    }
    Credentials writer{token_.pid, token_.uid, token_.gid};
    if (stampsWriters_) {
      writer = {};
      for (cmsghdr* c = CMSG_FIRSTHDR(&message); c != nullptr; c = CMSG_NXTHDR(&message, c)) {
        if (c->cmsg_level == SOL_SOCKET && c->cmsg_type == SCM_CREDENTIALS &&
            c->cmsg_len >= CMSG_LEN(sizeof(ucred))) {
          ucred credentials;
          std::memcpy(&credentials, CMSG_DATA(c), sizeof credentials);
          writer = {credentials.pid, credentials.uid, credentials.gid};
        }
      }
      if (writer.pid != 0 && !uidServed(writer.uid)) {
        close(fmt::format("written by pid {} of uid {}", writer.pid, writer.uid));
        return;
      }
    }
    ++reads_;
    if (!consume(buffer, static_cast<size_t>(n), writer)) return;
    // A short read emptied the socket, or stopped where the next bytes' writer differs: either
    // way the wait readMore arms re-arms the descriptor, which reports bytes already there at
    // once. Reading on would cost a call that mostly answers EAGAIN.
    if (static_cast<size_t>(n) < kReadChunk) break;
  }
  readMore();
}

// Takes the bytes of one read, all written by writer (the kernel never joins the bytes of two
// writers in one read); false when the connection has closed.
bool Connection::consume(const uint8_t* data, size_t size, const Credentials& writer) {
  if (heldStart_ < held_.size()) {
    // Only the start of one frame is held when we read: complete it first.
    if (writer != heldWriter_) {
      close("a frame written by more than one process");
      return false;
    }
    while (size > 0) {
      size_t held = held_.size() - heldStart_;
      size_t want;
      if (held < kHeaderSize) {
        want = kHeaderSize - held;
      } else {
        FrameHeader header = decodeHeader(held_.data() + heldStart_);
        if (header.length > kMaxBodySize) break;  // refused by parseHeldInput below
        size_t total = kHeaderSize + header.length;
        if (held >= total) break;
        want = total - held;
      }
      size_t take = std::min(want, size);
      holdInput(data, take, writer);
      data += take;
      size -= take;
    }
    parseHeldInput();
    if (closed_) return false;
    if (heldStart_ < held_.size()) {
      // Still not whole (all of this read went into it), or a pause left frames held.
      if (size > 0) holdInput(data, size, writer);
      return true;
    }
  }
  if (size == 0) return true;
  size_t used = parseFrames(data, size, writer);
  if (closed_) return false;
  if (used < size) holdInput(data + used, size - used, writer);
  return true;
}

// Delivers the whole frames at the start of data until a pause; answers the bytes used.
size_t Connection::parseFrames(const uint8_t* data, size_t size, const Credentials& writer) {
  size_t used = 0;
  while (!closed_ && !waitingFull()) {
    size_t available = size - used;
    if (available < kHeaderSize) break;
    FrameHeader header = decodeHeader(data + used);
    if (header.length > kMaxBodySize) {
      close(fmt::format("frame of {} bytes", header.length));
      break;
    }
    if (available < kHeaderSize + header.length) break;
    const uint8_t* body = data + used + kHeaderSize;
    used += kHeaderSize + header.length;
    if (!deliverFrame(header, body, writer)) break;
  }
  return used;
}

void Connection::parseHeldInput() {
  if (heldStart_ >= held_.size()) return;
  size_t used = parseFrames(held_.data() + heldStart_, held_.size() - heldStart_, heldWriter_);
  if (closed_) return;
  dropHeldInput(used);
}

void Connection::holdInput(const uint8_t* data, size_t size, const Credentials& writer) {
  if (size == 0) return;
  if (heldStart_ >= held_.size()) {
    held_.clear();
    heldStart_ = 0;
    heldWriter_ = writer;
    armDeadline();
  }
  held_.insert(held_.end(), data, data + size);
  gHeldInput.fetch_add(size, std::memory_order_relaxed);
}

void Connection::dropHeldInput(size_t count) {
  if (count == 0) return;
  heldStart_ += count;
  subtract(gHeldInput, count);
  if (heldStart_ >= held_.size()) {
    // Given back: a frame of megabytes must not stay with the connection once parsed.
    std::vector<uint8_t>().swap(held_);
    heldStart_ = 0;
    ++heldGeneration_;
  } else if (heldStart_ >= held_.size() / 2) {
    held_.erase(held_.begin(), held_.begin() + static_cast<ptrdiff_t>(heldStart_));
    heldStart_ = 0;
  }
}

void Connection::armDeadline() {
  if (!deadline_) deadline_ = std::make_unique<asio::steady_timer>(strand_);
  deadline_->expires_after(kFrameDeadline);
  deadline_->async_wait(
      [weak = weak_from_this(), generation = heldGeneration_](const asio::error_code& ec) {
        auto self = weak.lock();
        if (ec || !self || self->closed_) return;
        if (self->heldGeneration_ != generation || self->heldStart_ >= self->held_.size()) return;
        // Held because we paused reading, not because the peer is slow: give it its time again.
        if (self->waitingFull()) {
          self->armDeadline();
          return;
        }
        self->close(fmt::format("frame incomplete {} s after it began", kFrameDeadline.count()));
      });
}

bool Connection::deliverFrame(const FrameHeader& header, const uint8_t* bodyBytes,
                              const Credentials& writer) {
  auto body = cbor::decode(std::span(bodyBytes, header.length));
  if (!body) {
    close(body.error().message);
    return false;
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
    return true;
  }
  size_t bytes = kHeaderSize + header.length;
  waiting_.fetch_add(1);
  waitingBytes_.fetch_add(bytes);
  gHeldInput.fetch_add(bytes, std::memory_order_relaxed);
  Event event;
  event.type = EventType::Message;
  event.message = Message{std::move(body).value(),
                          header.id,
                          header.flags,
                          writer,
                          reads_,
                          std::make_shared<WaitingTicket>(weak_from_this(), bytes)};
  deliver(std::move(event));
  return true;
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
      subtract(gQueuedOutput, queuedBytes_);
      queuedBytes_ = 0;
    }
  }
  slot_.reset();
  subtract(gHeldInput, held_.size() - heldStart_);
  std::vector<uint8_t>().swap(held_);
  heldStart_ = 0;
  if (deadline_) deadline_->cancel();
  if (retry_) retry_->cancel();
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

void Connection::releaseWaiting(size_t bytes) {
  waiting_.fetch_sub(1);
  waitingBytes_.fetch_sub(bytes);
  if (resumeOnRelease_.exchange(false)) {
    asio::post(strand_, [self = shared_from_this()] { self->readMore(); });
  }
}

void Connection::enqueueOutput(std::vector<uint8_t> frame, const Message* answered) {
  if (answered && answered->ticket) answered->ticket->release();
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
    size_t rest = frame.size() - sent;
    // One frame of any size a frame may have is always taken: a large answer is not a peer
    // that fails to read. What piles up behind it is bounded, and so is all output together.
    if (!failNow && queuedBytes_ > 0 && queuedBytes_ + frame.size() > kMaxQueuedOutput) {
      log::process().throttled(gClosingThrottle, log::Level::Error,
                               "closing connection from pid=%d: it does not read its replies",
                               pid());
      failNow = true;
    } else if (!failNow && gQueuedOutput.fetch_add(rest) + rest > kMaxQueuedOutputTotal) {
      subtract(gQueuedOutput, rest);
      log::process().throttled(
          gClosingThrottle, log::Level::Error,
          "closing connection from pid=%d: replies waiting for all clients exceed %zu bytes", pid(),
          kMaxQueuedOutputTotal);
      failNow = true;
    } else if (!failNow) {
      queuedBytes_ += rest;
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
      subtract(gQueuedOutput, queuedBytes_);
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
                        size_t done = std::min(written, self->queuedBytes_);
                        self->queuedBytes_ -= done;
                        subtract(gQueuedOutput, done);
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
  enqueueOutput(std::move(frame), nullptr);
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
  enqueueOutput(std::move(frame), nullptr);
}

void Connection::reply(const Message& request, const Value& reply) {
  if (!request.wantsReply()) {
    dropRequest(request);
    return;
  }
  std::vector<uint8_t> frame;
  appendFrame(frame, reply, kFlagReply, request.id);
  enqueueOutput(std::move(frame), &request);
}

void Connection::replyEncoded(const Message& request, std::vector<uint8_t> frame) {
  if (!request.wantsReply()) {
    dropRequest(request);
    return;
  }
  if (frame.size() < kHeaderSize) throw std::logic_error("reply frame without its header");
  encodeHeader({static_cast<uint32_t>(frame.size() - kHeaderSize), kFlagReply, request.id},
               frame.data());
  enqueueOutput(std::move(frame), &request);
}

void Connection::dropRequest(const Message& request) {
  if (request.ticket) request.ticket->release();
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
      listener->prepare();
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
  // The file takes the socket's mode when it is bound: it is never open to others, not even
  // for a moment. The uid check at accept holds whatever the mode.
  if (!ec) ::fchmod(acceptor.native_handle(), 0600);
  if (!ec) acceptor.bind(stream_protocol::endpoint(path), ec);
  if (!ec && ::chmod(path.c_str(), 0600) != 0) ec.assign(errno, asio::system_category());
  if (!ec) acceptor.listen(SOMAXCONN, ec);
  if (ec) return EkError::posix(ec.value(), fmt::format("listening on {}: {}", path, ec.message()));
  listener->prepare();
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

void Listener::prepare() {
  // Accepted sockets inherit this, and bytes written before the accept carry credentials too.
  int on = 1;
  ::setsockopt(acceptor_.native_handle(), SOL_SOCKET, SO_PASSCRED, &on, sizeof on);
}

size_t Listener::connectionLimit() const {
  // Read at every accept: an administrator may change the limit of a running daemon.
  struct rlimit files {};
  if (::getrlimit(RLIMIT_NOFILE, &files) != 0 || files.rlim_cur == RLIM_INFINITY) {
    return kMaxConnections;
  }
  size_t usable = files.rlim_cur > kReservedDescriptors ? files.rlim_cur - kReservedDescriptors : 0;
  return std::clamp<size_t>(usable / kDescriptorsPerConnection, 1, kMaxConnections);
}

void Listener::acceptMore() {
  if (cancelled_) return;
  acceptor_.async_accept(asio::bind_executor(
      strand_,
      [self = shared_from_this()](const asio::error_code& ec, stream_protocol::socket socket) {
        if (self->cancelled_) return;
        if (ec) {
          if (ec == asio::error::operation_aborted) return;
          self->backOff(ec);
          return;
        }
        self->backoff_ = std::chrono::milliseconds(0);
        self->accepted(std::move(socket));
        self->acceptMore();
      }));
}

void Listener::backOff(const asio::error_code& ec) {
  static log::Throttle throttle;
  uint64_t suppressed = 0;
  if (handler_ && throttle.admit(&suppressed)) {
    std::string message = ec.message();
    if (suppressed > 0) message += fmt::format(" ({} similar errors suppressed)", suppressed);
    EkError error{std::string(kErrorDomain), ec.value(), std::move(message)};
    queue_->async([handler = handler_, error] { handler({nullptr, error}); });
  }
  // Out of descriptors and the like: back off, longer while it lasts, instead of spinning.
  // The peers wait in the backlog and are served once descriptors are free again.
  backoff_ =
      std::clamp(backoff_ * 2, std::chrono::milliseconds(10), std::chrono::milliseconds(500));
  auto timer = std::make_shared<asio::steady_timer>(strand_);
  timer->expires_after(backoff_);
  timer->async_wait(
      [self = shared_from_this(), timer](const asio::error_code&) { self->acceptMore(); });
}

void Listener::accepted(stream_protocol::socket socket) {
  static log::Throttle refusals;
  static std::mutex refusedMutex;
  static std::set<uid_t> refusedUids;
  auto token = AuditToken::forSocket(socket.native_handle());
  if (!token) return;
  if (!uidServed(token->uid)) {
    bool first = false;
    {
      std::lock_guard lock(refusedMutex);
      // Bounded like everything a peer can grow: past it, refusals are only throttled.
      if (refusedUids.size() < 1024) first = refusedUids.insert(token->uid).second;
    }
    if (first) {
      log::process().throttled(refusals, log::Level::Error,
                               "refused connection from pid=%d: uid %u is not served", token->pid,
                               token->uid);
    }
    return;
  }
  if (count_->load() >= connectionLimit()) {
    static log::Throttle full;
    log::process().throttled(full, log::Level::Error,
                             "refused connection from pid=%d: %zu connections already", token->pid,
                             count_->load());
    return;
  }
  count_->fetch_add(1);
  std::shared_ptr<void> slot(nullptr, [count = count_](void*) { count->fetch_sub(1); });
  if (!handler_) return;
  auto connection = Connection::adopt(std::move(socket), std::move(*token), std::move(slot));
  queue_->async([handler = handler_, connection] { handler({connection, std::nullopt}); });
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
