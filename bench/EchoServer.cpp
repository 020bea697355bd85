#include "bench/EchoServer.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "bench/FrameIo.h"

namespace ek::bench {

Result<std::unique_ptr<EchoServer>> EchoServer::start(Responder responder) {
  std::unique_ptr<EchoServer> server(new EchoServer());
  server->responder_ = std::move(responder);

  const char* tmp = std::getenv("TMPDIR");
  std::string base = (tmp && *tmp) ? tmp : "/tmp";
  std::string pattern = base + "/ekbench-XXXXXX";
  if (::mkdtemp(pattern.data()) == nullptr) {
    return EkError::fromErrno(errno, "creating a directory for the echo server");
  }
  server->directory_ = pattern;
  server->socketPath_ = pattern + "/echo";

  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (server->socketPath_.size() >= sizeof(address.sun_path)) {
    return EkError::posix(ENAMETOOLONG, "echo socket path too long: " + server->socketPath_);
  }
  std::memcpy(address.sun_path, server->socketPath_.data(), server->socketPath_.size());
  server->listenFd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (server->listenFd_ < 0) return EkError::fromErrno(errno, "echo socket");
  if (::bind(server->listenFd_, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) !=
          0 ||
      ::listen(server->listenFd_, 128) != 0) {
    return EkError::fromErrno(errno, "listening on " + server->socketPath_);
  }
  int pipeFds[2];
  if (::pipe2(pipeFds, O_CLOEXEC) != 0) return EkError::fromErrno(errno, "echo wake pipe");
  server->wakeRead_ = pipeFds[0];
  server->wakeWrite_ = pipeFds[1];
  server->acceptThread_ = std::thread([raw = server.get()] { raw->acceptLoop(); });
  return server;
}

EchoServer::~EchoServer() {
  if (acceptThread_.joinable()) {
    char byte = 1;
    while (::write(wakeWrite_, &byte, 1) < 0 && errno == EINTR) {
    }
    acceptThread_.join();
  }
  {
    std::lock_guard lock(clientsMutex_);
    for (Client& client : clients_) ::shutdown(client.fd, SHUT_RDWR);
    for (Client& client : clients_) {
      client.thread.join();
      ::close(client.fd);
    }
    clients_.clear();
  }
  for (int fd : {listenFd_, wakeRead_, wakeWrite_}) {
    if (fd >= 0) ::close(fd);
  }
  if (!socketPath_.empty()) ::unlink(socketPath_.c_str());
  if (!directory_.empty()) ::rmdir(directory_.c_str());
}

void EchoServer::acceptLoop() {
  for (;;) {
    pollfd fds[2] = {{listenFd_, POLLIN, 0}, {wakeRead_, POLLIN, 0}};
    if (::poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      return;
    }
    if (fds[1].revents != 0) return;
    if (fds[0].revents == 0) continue;
    int fd = ::accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0) {
      if (errno == EINTR || errno == ECONNABORTED || errno == EAGAIN) continue;
      return;
    }
    accepted_.fetch_add(1);
    std::lock_guard lock(clientsMutex_);
    reapFinished();
    Client& client = clients_.emplace_back();
    client.fd = fd;
    client.thread = std::thread([this, &client] { serve(client); });
  }
}

void EchoServer::reapFinished() {
  for (auto it = clients_.begin(); it != clients_.end();) {
    if (it->done.load()) {
      it->thread.join();
      ::close(it->fd);
      it = clients_.erase(it);
    } else {
      ++it;
    }
  }
}

void EchoServer::serve(Client& client) {
  FrameReader reader;
  std::vector<uint8_t> out;
  std::vector<uint8_t> body;
  wyre::FrameHeader header;
  std::span<const uint8_t> received;
  while (reader.next(client.fd, header, received) == FrameReader::Status::Frame) {
    if (!(header.flags & wyre::kFlagWantsReply)) continue;
    wyre::FrameHeader replyHeader{header.length, wyre::kFlagReply, header.id};
    out.resize(wyre::kHeaderSize);
    if (responder_) {
      body.assign(received.begin(), received.end());
      Action action = responder_(replyHeader, body);
      if (action == Action::Close) break;
      if (action == Action::Silent) continue;
      replyHeader.length = static_cast<uint32_t>(body.size());
      out.insert(out.end(), body.begin(), body.end());
    } else {
      out.insert(out.end(), received.begin(), received.end());
    }
    wyre::encodeHeader(replyHeader, out.data());
    if (!writeAll(client.fd, out.data(), out.size())) break;
  }
  // The destructor or the accept loop closes the descriptor, so that it cannot be reused
  // while another thread still names it.
  ::shutdown(client.fd, SHUT_RDWR);
  client.done.store(true);
}

}  // namespace ek::bench
