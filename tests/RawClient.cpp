#include "tests/RawClient.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>

#include "platform/cbor/Cbor.h"
#include "platform/wyre/Wyre.h"

namespace ek::test {

RawClient::RawClient(const std::string& socketPath) {
  fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, socketPath.c_str(), sizeof address.sun_path - 1);
  if (connect(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
    close(fd_);
    fd_ = -1;
  }
}

RawClient::~RawClient() {
  if (fd_ >= 0) close(fd_);
}

bool RawClient::sendBytes(const std::vector<uint8_t>& bytes) {
  size_t sent = 0;
  while (sent < bytes.size()) {
    ssize_t n = send(fd_, bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
    if (n <= 0) return false;
    sent += static_cast<size_t>(n);
  }
  return true;
}

bool RawClient::sendMessage(const Value& body, uint64_t id, bool wantsReply) {
  std::vector<uint8_t> frame;
  wyre::appendFrame(frame, body, wantsReply ? wyre::kFlagWantsReply : 0, id);
  return sendBytes(frame);
}

bool RawClient::readExactly(uint8_t* out, size_t n,
                            std::chrono::steady_clock::time_point deadline) {
  size_t got = 0;
  while (got < n) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return false;
    pollfd p{fd_, POLLIN, 0};
    if (poll(&p, 1, static_cast<int>(left.count())) <= 0) return false;
    ssize_t r = recv(fd_, out + got, n - got, 0);
    if (r <= 0) return false;
    got += static_cast<size_t>(r);
  }
  return true;
}

std::optional<RawClient::Frame> RawClient::readFrame(std::chrono::milliseconds timeout) {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  uint8_t header[wyre::kHeaderSize];
  if (!readExactly(header, sizeof header, deadline)) return std::nullopt;
  auto decoded = wyre::decodeHeader(header);
  std::vector<uint8_t> body(decoded.length);
  if (!readExactly(body.data(), body.size(), deadline)) return std::nullopt;
  auto value = cbor::decode(body);
  if (!value) return std::nullopt;
  return Frame{decoded.flags, decoded.id, std::move(value).value()};
}

bool RawClient::closedByPeer(std::chrono::milliseconds timeout) {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  char buffer[65536];
  while (true) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return false;
    pollfd p{fd_, POLLIN, 0};
    if (poll(&p, 1, static_cast<int>(left.count())) <= 0) return false;
    ssize_t r = recv(fd_, buffer, sizeof buffer, 0);
    if (r == 0) return true;
    if (r < 0) return errno == ECONNRESET;
  }
}

Value request(std::string_view type, Dictionary extra) {
  extra.emplace("request", Value(type));
  extra.emplace("version", Value(3));
  return Value(std::move(extra));
}

}  // namespace ek::test
