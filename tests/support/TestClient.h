#pragma once

// A blocking test client over one unix-socket connection, and the waiting helpers of the tests
// that use real sockets.

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <optional>
#include <string>
#include <thread>
#include <variant>
#include <vector>

#include "protocol/Codec.h"
#include "protocol/Frame.h"

namespace tavrin::testing {

// Generous: the machine may be busy compiling while tests run.
inline constexpr auto kE2eTimeout = std::chrono::seconds(20);

inline std::string MakeTempDirectory(const char* prefix) {
  std::string pattern = (std::filesystem::temp_directory_path() / prefix).string() + "XXXXXX";
  if (mkdtemp(pattern.data()) == nullptr) std::abort();
  return pattern;
}

inline sockaddr_un UnixAddress(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::snprintf(address.sun_path, sizeof(address.sun_path), "%s", path.c_str());
  return address;
}

// The whole file at `path` ("" when it cannot be read).
inline std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(in), {}};
}

// How many times `needle` occurs in `text`.
inline size_t Occurrences(const std::string& text, const std::string& needle) {
  size_t count = 0;
  for (size_t at = text.find(needle); at != std::string::npos; at = text.find(needle, at + 1)) {
    ++count;
  }
  return count;
}

// A unix socket bound at `path`, listening when `listen` is set (-1 on failure). Closed unheard,
// it leaves the file a service that is gone leaves behind.
inline int BindUnixSocket(const std::string& path, bool listen) {
  const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un address = UnixAddress(path);
  if (::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)) != 0 ||
      (listen && ::listen(fd, 16) != 0)) {
    ::close(fd);
    return -1;
  }
  return fd;
}

// Polls `done` until it holds or the e2e time-out passes.
template <typename Predicate>
bool WaitUntil(Predicate done) {
  const auto deadline = std::chrono::steady_clock::now() + kE2eTimeout;
  while (std::chrono::steady_clock::now() < deadline) {
    if (done()) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return false;
}

// "CALL STATUS" of a reply, and "DOMAIN CODE" after them for an error; "none" when none came.
inline std::string Describe(const std::optional<protocol::Reply>& reply) {
  if (!reply) return "none";
  std::string text = std::to_string(reply->call) + " " + std::to_string(int(reply->status));
  if (reply->status == protocol::Status::kOk) return text;
  return text + " " + reply->value.value("domain", "") + " " +
         std::to_string(reply->value.value("code", 0));
}

// A blocking client over one connection: sends raw frames or requests, reads replies with a
// time-out.
class TestClient {
 public:
  explicit TestClient(const std::string& socketPath) {
    fd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address = UnixAddress(socketPath);
    connected_ = ::connect(fd_, reinterpret_cast<sockaddr*>(&address), sizeof(address)) == 0;
  }
  ~TestClient() { Close(); }
  TestClient(const TestClient&) = delete;
  TestClient& operator=(const TestClient&) = delete;

  bool connected() const { return connected_; }
  void Close() {
    if (fd_ >= 0) ::close(fd_);
    fd_ = -1;
  }

  bool SendBytes(const std::vector<uint8_t>& bytes) {
    size_t sent = 0;
    while (sent < bytes.size()) {
      const ssize_t n = ::send(fd_, bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
      if (n <= 0) return false;
      sent += static_cast<size_t>(n);
    }
    return true;
  }
  bool SendBody(const std::vector<uint8_t>& body) { return SendBytes(protocol::EncodeFrame(body)); }
  bool Send(uint64_t call, protocol::Arguments arguments) {
    return SendBody(protocol::EncodeRequest(protocol::Request{call, std::move(arguments)}));
  }
  bool SendNoReply(protocol::Arguments arguments) {
    return SendBody(protocol::EncodeRequest(protocol::Request{std::nullopt, std::move(arguments)}));
  }
  // Sends `arguments` under this client's next call number (from 1,000,000 up, clear of the
  // numbers tests choose) and reads the next reply.
  std::optional<protocol::Reply> Call(protocol::Arguments arguments,
                                      std::chrono::milliseconds timeout = kE2eTimeout) {
    Send(++calls_, std::move(arguments));
    return Read(timeout);
  }

  // The next reply, or nothing when none came in time or the connection ended.
  std::optional<protocol::Reply> Read(std::chrono::milliseconds timeout = kE2eTimeout) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    for (;;) {
      const auto status = reader_.Next();
      if (status == protocol::FrameReader::Status::kFrame) {
        auto decoded = protocol::DecodeReply(reader_.Body());
        if (auto* reply = std::get_if<protocol::Reply>(&decoded)) return *reply;
        std::fprintf(stderr, "TestClient: undecodable reply: %s\n",
                     std::get<std::string>(decoded).c_str());
        return std::nullopt;
      }
      if (status == protocol::FrameReader::Status::kBadLength) return std::nullopt;
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      if (left.count() <= 0) return std::nullopt;
      pollfd poller{fd_, POLLIN, 0};
      if (::poll(&poller, 1, static_cast<int>(left.count())) <= 0) return std::nullopt;
      uint8_t buffer[65536];
      const ssize_t n = ::recv(fd_, buffer, sizeof(buffer), 0);
      if (n <= 0) return std::nullopt;
      reader_.Append(std::span<const uint8_t>(buffer, static_cast<size_t>(n)));
    }
  }

  // True when the service closed the connection (end of stream within the time-out).
  bool WaitForClose(std::chrono::milliseconds timeout = kE2eTimeout) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline) {
      pollfd poller{fd_, POLLIN, 0};
      if (::poll(&poller, 1, 50) > 0) {
        uint8_t buffer[4096];
        const ssize_t n = ::recv(fd_, buffer, sizeof(buffer), 0);
        if (n <= 0) return true;
      }
    }
    return false;
  }

 private:
  int fd_ = -1;
  bool connected_ = false;
  uint64_t calls_ = 1'000'000;
  protocol::FrameReader reader_;
};

}  // namespace tavrin::testing
