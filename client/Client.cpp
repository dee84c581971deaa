#include "tavrin/Client.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <map>
#include <mutex>
#include <random>
#include <thread>

#include <fmt/format.h>

#include "protocol/Codec.h"
#include "protocol/Frame.h"

namespace tavrin::client {
namespace {

using protocol::Op;

// A write that cannot make progress for this long means the service stopped reading; the
// connection is given up (a half-written frame cannot be taken back).
constexpr auto kWriteStallLimit = std::chrono::seconds(30);
// Replies are small (the largest is the reporter list of getAllReporters); this bounds what a
// broken service can make the client buffer.
constexpr uint32_t kReplyFrameLimit = 16 * protocol::kDefaultFrameLimit;
constexpr size_t kReadChunk = 64 * 1024;

Error MakeError(Errc code, std::string message) { return Error{code, {}, 0, std::move(message)}; }

timeval ToTimeval(std::chrono::milliseconds duration) {
  const auto ms = std::max<int64_t>(duration.count(), 1);
  return timeval{static_cast<time_t>(ms / 1000), static_cast<suseconds_t>((ms % 1000) * 1000)};
}

// The error of a status 1 or 2 reply, with a message that says what it means.
Error ServiceError(const protocol::Reply& reply) {
  const auto error = protocol::ReplyError(reply);
  Error result;
  result.domain = error ? error->domain : std::string();
  result.serviceCode = error ? error->code : 0;
  if (reply.status == protocol::Status::kRejected) {
    result.code = Errc::kRejected;
    result.message =
        fmt::format("the service did not understand the request: {} ({} {})",
                    error ? error->description : "", result.domain, result.serviceCode);
  } else if (result.domain == protocol::kReportingErrorDomain &&
             result.serviceCode == protocol::kReportingDisabledCode) {
    result.code = Errc::kOperationError;
    result.message =
        "reporting is disabled on the service (setting disable_reporting); messages are refused "
        "until it is turned off";
  } else {
    result.code = Errc::kOperationError;
    result.message = fmt::format("the operation failed: {} {}", result.domain, result.serviceCode);
  }
  return result;
}

// Status 0 values by the type the operation answers.
template <typename T>
std::optional<T> AnswerValue(const Value& value);
template <>
std::optional<bool> AnswerValue<bool>(const Value& value) {
  return protocol::BoolReplyValue(value);
}
template <>
std::optional<uint16_t> AnswerValue<uint16_t>(const Value& value) {
  return protocol::ServiceTypeReplyValue(value);
}
template <>
std::optional<Validity> AnswerValue<Validity>(const Value& value) {
  const auto dictionary = protocol::ValidityReplyValue(value);
  if (!dictionary) return std::nullopt;
  return Validity{protocol::IntegerAs<int64_t>(dictionary->at("reporterID")).value_or(0),
                  protocol::IntegerAs<uint16_t>(dictionary->at("serviceType")).value_or(0xFFFF)};
}
template <>
std::optional<std::vector<int64_t>> AnswerValue<std::vector<int64_t>>(const Value& value) {
  return protocol::ReportersReplyValue(value);
}
template <>
std::optional<Done> AnswerValue<Done>(const Value& value) {
  if (!protocol::IsNilReplyValue(value)) return std::nullopt;
  return Done{};
}

template <>
std::optional<Dictionary> AnswerValue<Dictionary>(const Value& value) {
  if (!value.is_object()) return std::nullopt;
  return value;
}

template <typename T>
Result<T> TypedResult(const protocol::Reply& reply) {
  if (reply.status != protocol::Status::kOk) return ServiceError(reply);
  auto value = AnswerValue<T>(reply.value);
  if (!value) {
    return MakeError(Errc::kBadReply,
                     fmt::format("the service answered {} where this call expects another kind "
                                 "of value; is the service the same version as this library?",
                                 JsonText(reply.value)));
  }
  return std::move(*value);
}

// Holds the first answer of a blocking call until the caller takes it.
template <typename T>
struct Waiter {
  std::mutex mutex;
  std::condition_variable answered;
  std::optional<Result<T>> result;

  void Set(Result<T> value) {
    std::lock_guard lock(mutex);
    if (!result) result.emplace(std::move(value));
    answered.notify_all();
  }
};

}  // namespace

std::string_view ErrcName(Errc code) {
  switch (code) {
    case Errc::kNotRunning:
      return "not running";
    case Errc::kPermissionDenied:
      return "permission denied";
    case Errc::kConnectionLost:
      return "connection lost";
    case Errc::kTimedOut:
      return "timed out";
    case Errc::kNoReply:
      return "no reply";
    case Errc::kOperationError:
      return "operation error";
    case Errc::kRejected:
      return "rejected";
    case Errc::kBadReply:
      return "bad reply";
    case Errc::kWouldDeadlock:
      return "would deadlock";
    case Errc::kInvalidArgument:
      return "invalid argument";
  }
  return "unknown";
}

std::string ResolveSocketPath(std::string_view requested) {
  if (!requested.empty()) return std::string(requested);
  if (const char* socket = std::getenv("TAVRIN_SOCKET"); socket && *socket) return socket;
  if (const char* root = std::getenv("TAVRIN_ROOT"); root && *root) {
    return std::string(root) + "/run/reporting.sock";
  }
  return std::string(kDefaultSocketPath);
}

int64_t NewReporterID() {
  static std::mutex mutex;
  static std::mt19937_64 generator{std::random_device{}()};
  std::lock_guard lock(mutex);
  int64_t id = 0;
  while (id == 0) id = static_cast<int64_t>(generator() >> 1);
  return id;
}

// The connection: one socket, one reader thread that decodes replies and runs the handlers, and
// the table of calls still waiting for an answer.
namespace detail {

class Connection {
 public:
  // What a waiting call does with its answer (or with the error that ends its wait).
  using RawHandler = std::function<void(Result<protocol::Reply>)>;

  Connection(int fd, std::string socketPath) : fd_(fd), socketPath_(std::move(socketPath)) {
    reader_ = std::thread([this] { ReadLoop(); });
  }

  ~Connection() {
    Close();
    ::close(fd_);
  }

  const std::string& SocketPath() const { return socketPath_; }

  bool Connected() const {
    std::lock_guard lock(mutex_);
    return !ended_;
  }

  size_t PendingCalls() const {
    std::lock_guard lock(mutex_);
    return pending_.size();
  }

  bool OnReaderThread() const { return std::this_thread::get_id() == reader_.get_id(); }

  void Close() {
    {
      std::lock_guard lock(mutex_);
      closedByClient_ = true;
    }
    ::shutdown(fd_, SHUT_RDWR);
    if (OnReaderThread()) return;  // the reader ends by itself once this handler returns
    std::lock_guard lock(joinMutex_);
    if (reader_.joinable()) reader_.join();
  }

  // Sends a request that wants `replies` answers (0: none). Answers `handler` exactly once per
  // answer, or once with an error; returns the call number (0 when the request was not sent).
  uint64_t Call(protocol::Arguments arguments, int replies, RawHandler handler) {
    const Op op = static_cast<Op>(arguments.index() + protocol::kFirstOp);
    const int64_t reporter = ReporterOf(arguments);
    protocol::Request request{std::nullopt, std::move(arguments)};
    uint64_t call = 0;
    std::optional<Error> refused;
    {
      std::lock_guard lock(mutex_);
      if (ended_) {
        refused = endError_;
      } else if (replies > 0) {
        call = nextCall_++;
        request.call = call;
        pending_.emplace(call, Pending{op, reporter, replies, std::move(handler)});
      }
    }
    if (refused) {
      Invoke(handler, std::move(*refused));
      return 0;
    }
    if (auto failed = Write(request)) {
      if (call != 0) {
        std::lock_guard lock(mutex_);
        if (auto it = pending_.find(call); it != pending_.end()) {
          handler = std::move(it->second.handler);
          pending_.erase(it);
        }
        // else the reader has already ended the call with the connection's error
      }
      Invoke(handler, std::move(*failed));
      return 0;
    }
    if (op == Op::kKillService) AwaitEnd(std::move(handler));
    return call;
  }

  // Forgets a call whose caller stopped waiting.
  void Forget(uint64_t call) {
    std::lock_guard lock(mutex_);
    pending_.erase(call);
  }

 private:
  struct Pending {
    Op op;
    int64_t reporterID;
    int repliesLeft;
    RawHandler handler;
  };

  // Answers `handler` when the connection ends: success when the service ended it.
  void AwaitEnd(RawHandler handler) {
    {
      std::lock_guard lock(mutex_);
      if (!ended_) {
        killWaiters_.push_back(std::move(handler));
        return;
      }
    }
    Invoke(handler, EndAnswer());
  }

  Result<protocol::Reply> EndAnswer() const {
    std::lock_guard lock(mutex_);
    if (closedByClient_) return endError_;
    return protocol::Reply{};
  }

  static int64_t ReporterOf(const protocol::Arguments& arguments) {
    return std::visit(
        [](const auto& args) -> int64_t {
          if constexpr (requires { args.reporterID; }) {
            return args.reporterID;
          } else {
            return 0;
          }
        },
        arguments);
  }

  static void Invoke(const RawHandler& handler, Result<protocol::Reply> result) {
    if (!handler) return;
    try {
      handler(std::move(result));
    } catch (...) {
      // A handler's exception must not end the reader thread and with it every other call.
    }
  }

  // Encodes and writes one request; the error when it could not be written.
  std::optional<Error> Write(const protocol::Request& request) {
    std::vector<uint8_t> frame;
    try {
      frame = protocol::EncodeFrame(protocol::EncodeRequest(request));
    } catch (const std::exception& e) {
      return MakeError(Errc::kInvalidArgument,
                       fmt::format("the request cannot be encoded: {}", e.what()));
    }
    if (frame.size() - protocol::kFrameHeaderSize > protocol::kDefaultFrameLimit) {
      return MakeError(
          Errc::kInvalidArgument,
          fmt::format("the request is {} bytes, more than the service's frame "
                      "limit of {} bytes; send smaller messages",
                      frame.size() - protocol::kFrameHeaderSize, protocol::kDefaultFrameLimit));
    }
    std::lock_guard lock(writeMutex_);
    size_t sent = 0;
    while (sent < frame.size()) {
      const ssize_t n = ::send(fd_, frame.data() + sent, frame.size() - sent, MSG_NOSIGNAL);
      if (n > 0) {
        sent += static_cast<size_t>(n);
        continue;
      }
      if (n < 0 && errno == EINTR) continue;
      const bool stalled = n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK);
      Error error = MakeError(
          Errc::kConnectionLost,
          stalled ? fmt::format("the service at {} stopped reading requests; connection closed",
                                socketPath_)
                  : fmt::format("the connection to the service at {} is gone ({}); is tavrind "
                                "still running?",
                                socketPath_, std::strerror(errno)));
      ::shutdown(fd_, SHUT_RDWR);  // the reader ends the connection and fails waiting calls
      return error;
    }
    return std::nullopt;
  }

  void ReadLoop() {
    protocol::FrameReader frames(kReplyFrameLimit);
    std::vector<uint8_t> buffer(kReadChunk);
    Error end;
    for (;;) {
      const ssize_t n = ::recv(fd_, buffer.data(), buffer.size(), 0);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) {
        end = MakeError(Errc::kConnectionLost,
                        fmt::format("the service at {} closed the connection{}; is tavrind still "
                                    "running?",
                                    socketPath_, frames.InsideFrame() ? " inside a reply" : ""));
        break;
      }
      frames.Append(std::span<const uint8_t>(buffer.data(), static_cast<size_t>(n)));
      std::optional<Error> broken = DrainFrames(frames);
      if (broken) {
        end = std::move(*broken);
        ::shutdown(fd_, SHUT_RDWR);
        break;
      }
    }
    End(std::move(end));
  }

  // Answers every complete reply; the error when the service sent something unreadable.
  std::optional<Error> DrainFrames(protocol::FrameReader& frames) {
    for (;;) {
      switch (frames.Next()) {
        case protocol::FrameReader::Status::kNeedMore:
          return std::nullopt;
        case protocol::FrameReader::Status::kBadLength:
          return MakeError(Errc::kBadReply,
                           fmt::format("the service sent a frame of {} bytes, outside 1 to {}; "
                                       "connection closed",
                                       frames.BadLength(), frames.FrameLimit()));
        case protocol::FrameReader::Status::kFrame:
          break;
      }
      auto decoded = protocol::DecodeReply(frames.Body());
      if (auto* reason = std::get_if<std::string>(&decoded)) {
        return MakeError(Errc::kBadReply,
                         fmt::format("the service sent an unreadable reply ({}); connection "
                                     "closed",
                                     *reason));
      }
      Dispatch(std::get<protocol::Reply>(std::move(decoded)));
    }
  }

  void Dispatch(protocol::Reply reply) {
    RawHandler handler;
    std::vector<RawHandler> dropped;
    {
      std::lock_guard lock(mutex_);
      auto it = pending_.find(reply.call);
      if (it == pending_.end()) {
        // A call given up by a timed-out blocking wait; its late answer has no one to go to.
        ++unclaimedReplies_;
        return;
      }
      Pending& pending = it->second;
      if (--pending.repliesLeft > 0) {
        handler = pending.handler;  // keep it for the next answer
      } else {
        handler = std::move(pending.handler);
        const Op op = pending.op;
        const int64_t reporter = pending.reporterID;
        pending_.erase(it);
        if (reply.status == protocol::Status::kOk)
          dropped = DroppedStarts(op, reporter, reply.call);
      }
    }
    // The starts were let go before the answer that reveals it, so they hear first.
    for (auto& start : dropped) {
      Invoke(start, MakeError(Errc::kNoReply,
                              "the session went away before it was stopped (destroyed, or "
                              "replaced by a new session under the same reporter ID), so the "
                              "service will never answer its start"));
    }
    Invoke(handler, std::move(reply));
  }

  // Held starts the service has let go of: a destroy or a re-create, on this connection, of a
  // session this connection created releases the session together with its held start answer.
  // Requests run in order, so exactly the starts sent between the session's creation and `call`
  // are affected. Called with mutex_ held.
  std::vector<RawHandler> DroppedStarts(Op op, int64_t reporter, uint64_t call) {
    std::vector<RawHandler> dropped;
    if (op != Op::kDestroyReportingSession && op != Op::kCreateReportingSession) return dropped;
    const auto created = createdHere_.find(reporter);
    if (reporter != 0 && created != createdHere_.end()) {
      for (auto it = pending_.upper_bound(created->second);
           it != pending_.end() && it->first < call;) {
        if (it->second.op == Op::kStartReportingSessionForID && it->second.reporterID == reporter) {
          dropped.push_back(std::move(it->second.handler));
          it = pending_.erase(it);
        } else {
          ++it;
        }
      }
    }
    if (op == Op::kCreateReportingSession) {
      createdHere_[reporter] = call;
    } else if (created != createdHere_.end()) {
      createdHere_.erase(created);
    }
    return dropped;
  }

  void End(Error error) {
    std::map<uint64_t, Pending> pending;
    std::vector<RawHandler> killWaiters;
    {
      std::lock_guard lock(mutex_);
      if (closedByClient_) {
        error = MakeError(Errc::kConnectionLost, "the connection was closed by this client");
      }
      ended_ = true;
      endError_ = error;
      pending.swap(pending_);
      killWaiters.swap(killWaiters_);
    }
    for (auto& [call, entry] : pending) Invoke(entry.handler, error);
    for (auto& handler : killWaiters) Invoke(handler, EndAnswer());
  }

  const int fd_;
  const std::string socketPath_;
  std::thread reader_;
  std::mutex joinMutex_;
  std::mutex writeMutex_;

  mutable std::mutex mutex_;
  uint64_t nextCall_ = 1;
  std::map<uint64_t, Pending> pending_;
  std::vector<RawHandler> killWaiters_;
  // Sessions this connection created and has not destroyed: reporter ID -> the create's call.
  std::map<int64_t, uint64_t> createdHere_;
  uint64_t unclaimedReplies_ = 0;
  bool ended_ = false;
  bool closedByClient_ = false;
  Error endError_;
};

}  // namespace detail

namespace {

// Runs `start` (which issues one call with the given handler and returns its call number) and
// waits for its first answer.
template <typename T, typename Start>
Result<T> Blocking(detail::Connection& impl, std::chrono::milliseconds timeout, Start start) {
  if (impl.OnReaderThread()) {
    return MakeError(Errc::kWouldDeadlock,
                     "a blocking call inside a reply handler would wait for itself; use the "
                     "asynchronous form there");
  }
  auto waiter = std::make_shared<Waiter<T>>();
  const uint64_t call = start([waiter](Result<T> result) { waiter->Set(std::move(result)); });
  std::unique_lock lock(waiter->mutex);
  if (!waiter->answered.wait_for(lock, timeout, [&] { return waiter->result.has_value(); })) {
    lock.unlock();
    impl.Forget(call);
    return MakeError(Errc::kTimedOut,
                     fmt::format("no answer from the service within {} ms", timeout.count()));
  }
  return std::move(*waiter->result);
}

template <typename T>
detail::Connection::RawHandler Typed(ReplyHandler<T> handler) {
  return [handler = std::move(handler)](Result<protocol::Reply> raw) {
    if (!handler) return;
    if (!raw) {
      handler(raw.error());
    } else {
      handler(TypedResult<T>(raw.value()));
    }
  };
}

}  // namespace

Result<std::unique_ptr<Client>> Client::Connect(const ConnectOptions& options) {
  const std::string path = ResolveSocketPath(options.socketPath);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof(address.sun_path)) {
    return MakeError(Errc::kInvalidArgument,
                     fmt::format("the socket path {} is longer than the {} bytes a unix socket "
                                 "path may have",
                                 path, sizeof(address.sun_path) - 1));
  }
  std::memcpy(address.sun_path, path.data(), path.size());
  const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    return MakeError(Errc::kConnectionLost,
                     fmt::format("cannot make a socket: {}", std::strerror(errno)));
  }
  // A full listen backlog makes connect() wait; the send time-out bounds that wait.
  timeval connectTimeout = ToTimeval(options.timeout);
  ::setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &connectTimeout, sizeof(connectTimeout));
  int result;
  do {
    result = ::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address));
  } while (result < 0 && errno == EINTR);
  if (result < 0) {
    const int error = errno;
    ::close(fd);
    const std::string hint =
        "Start the service (./scripts/run.sh), or point TAVRIN_SOCKET at its socket.";
    switch (error) {
      case ENOENT:
        return MakeError(
            Errc::kNotRunning,
            fmt::format("no service at {}: the socket does not exist. {}", path, hint));
      case ECONNREFUSED:
        return MakeError(
            Errc::kNotRunning,
            fmt::format("no service at {}: nothing listens on the socket. {}", path, hint));
      case ENOTDIR:
        return MakeError(
            Errc::kNotRunning,
            fmt::format("no service at {}: a part of the path is not a directory. {}", path, hint));
      case EACCES:
      case EPERM:
        return MakeError(Errc::kPermissionDenied,
                         fmt::format("not allowed to connect to {}; check the socket's mode "
                                     "(tavrind --socket-mode) and its directory's permissions",
                                     path));
      case EAGAIN:
        return MakeError(Errc::kTimedOut,
                         fmt::format("the service at {} did not accept the connection within "
                                     "{} ms",
                                     path, options.timeout.count()));
      default:
        return MakeError(Errc::kNotRunning,
                         fmt::format("cannot connect to {}: {}", path, std::strerror(error)));
    }
  }
  timeval writeTimeout = ToTimeval(std::chrono::duration_cast<std::chrono::milliseconds>(
      std::chrono::seconds(kWriteStallLimit)));
  ::setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &writeTimeout, sizeof(writeTimeout));
  return std::unique_ptr<Client>(new Client(std::make_unique<detail::Connection>(fd, path)));
}

Client::Client(std::unique_ptr<detail::Connection> impl) : impl_(std::move(impl)) {}
Client::~Client() = default;

const std::string& Client::socketPath() const { return impl_->SocketPath(); }
bool Client::connected() const { return impl_->Connected(); }
void Client::Close() { impl_->Close(); }
size_t Client::pendingCalls() const { return impl_->PendingCalls(); }

void Client::createReportingSession(int64_t reporterID, ReplyHandler<bool> reply) {
  impl_->Call(protocol::CreateReportingSession{reporterID}, 1, Typed(std::move(reply)));
}
Result<bool> Client::createReportingSession(int64_t reporterID, std::chrono::milliseconds timeout) {
  return Blocking<bool>(*impl_, timeout, [&](ReplyHandler<bool> reply) {
    return impl_->Call(protocol::CreateReportingSession{reporterID}, 1, Typed(std::move(reply)));
  });
}

void Client::setServiceType(uint16_t serviceType, int64_t reporterID, ReplyHandler<bool> reply) {
  impl_->Call(protocol::SetServiceType{serviceType, reporterID}, 1, Typed(std::move(reply)));
}
Result<bool> Client::setServiceType(uint16_t serviceType, int64_t reporterID,
                                    std::chrono::milliseconds timeout) {
  return Blocking<bool>(*impl_, timeout, [&](ReplyHandler<bool> reply) {
    return impl_->Call(protocol::SetServiceType{serviceType, reporterID}, 1,
                       Typed(std::move(reply)));
  });
}

namespace {
// Reporter ID 0 is answered twice.
int RepliesOfServiceName(int64_t reporterID) { return reporterID == 0 ? 2 : 1; }
}  // namespace

void Client::getServiceNameForReporterID(int64_t reporterID, ReplyHandler<uint16_t> reply) {
  impl_->Call(protocol::GetServiceNameForReporterID{reporterID}, RepliesOfServiceName(reporterID),
              Typed(std::move(reply)));
}
Result<uint16_t> Client::getServiceNameForReporterID(int64_t reporterID,
                                                     std::chrono::milliseconds timeout) {
  return Blocking<uint16_t>(*impl_, timeout, [&](ReplyHandler<uint16_t> reply) {
    return impl_->Call(protocol::GetServiceNameForReporterID{reporterID},
                       RepliesOfServiceName(reporterID), Typed(std::move(reply)));
  });
}

void Client::setConfiguration(const Dictionary& configuration, int64_t reporterID,
                              ReplyHandler<bool> reply) {
  impl_->Call(protocol::SetConfiguration{configuration, reporterID}, 1, Typed(std::move(reply)));
}
Result<bool> Client::setConfiguration(const Dictionary& configuration, int64_t reporterID,
                                      std::chrono::milliseconds timeout) {
  return Blocking<bool>(*impl_, timeout, [&](ReplyHandler<bool> reply) {
    return impl_->Call(protocol::SetConfiguration{configuration, reporterID}, 1,
                       Typed(std::move(reply)));
  });
}

void Client::startReportingSessionForID(int64_t reporterID, ReplyHandler<bool> reply) {
  impl_->Call(protocol::StartReportingSessionForID{reporterID}, 1, Typed(std::move(reply)));
}
Result<bool> Client::startReportingSessionForID(int64_t reporterID,
                                                std::chrono::milliseconds timeout) {
  return Blocking<bool>(*impl_, timeout, [&](ReplyHandler<bool> reply) {
    return impl_->Call(protocol::StartReportingSessionForID{reporterID}, 1,
                       Typed(std::move(reply)));
  });
}

namespace {

std::optional<Error> CheckMessage(const Dictionary& message) {
  if (message.is_object()) return std::nullopt;
  return MakeError(
      Errc::kInvalidArgument,
      fmt::format("a message must be a dictionary (a JSON object), not {}", message.type_name()));
}

}  // namespace

Result<Done> Client::sendMessage(const Dictionary& message, uint32_t category, uint16_t type,
                                 std::optional<std::vector<int64_t>> reporterIDs) {
  if (auto invalid = CheckMessage(message)) return std::move(*invalid);
  std::optional<Error> failure;
  impl_->Call(protocol::SendMessage{message, category, type, std::move(reporterIDs)}, 0,
              [&failure](Result<protocol::Reply> result) {
                if (!result) failure = result.error();
              });
  if (failure) return std::move(*failure);
  if (!impl_->Connected()) {
    return MakeError(Errc::kConnectionLost, "the connection to the service is gone");
  }
  return Done{};
}

void Client::sendMessage(const Dictionary& message, uint32_t category, uint16_t type,
                         std::optional<std::vector<int64_t>> reporterIDs,
                         ReplyHandler<Done> reply) {
  if (auto invalid = CheckMessage(message)) {
    if (reply) reply(std::move(*invalid));
    return;
  }
  impl_->Call(protocol::SendMessage{message, category, type, std::move(reporterIDs)}, 1,
              Typed(std::move(reply)));
}

Result<Done> Client::sendMessage(const Dictionary& message, uint32_t category, uint16_t type,
                                 std::optional<std::vector<int64_t>> reporterIDs,
                                 std::chrono::milliseconds timeout) {
  if (auto invalid = CheckMessage(message)) return std::move(*invalid);
  return Blocking<Done>(*impl_, timeout, [&](ReplyHandler<Done> reply) {
    return impl_->Call(protocol::SendMessage{message, category, type, std::move(reporterIDs)}, 1,
                       Typed(std::move(reply)));
  });
}

void Client::stopReportingSessionForID(int64_t reporterID, ReplyHandler<bool> reply) {
  impl_->Call(protocol::StopReportingSessionForID{reporterID}, 1, Typed(std::move(reply)));
}
Result<bool> Client::stopReportingSessionForID(int64_t reporterID,
                                               std::chrono::milliseconds timeout) {
  return Blocking<bool>(*impl_, timeout, [&](ReplyHandler<bool> reply) {
    return impl_->Call(protocol::StopReportingSessionForID{reporterID}, 1, Typed(std::move(reply)));
  });
}

void Client::destroyReportingSession(int64_t reporterID, ReplyHandler<bool> reply) {
  impl_->Call(protocol::DestroyReportingSession{reporterID}, 1, Typed(std::move(reply)));
}
Result<bool> Client::destroyReportingSession(int64_t reporterID,
                                             std::chrono::milliseconds timeout) {
  return Blocking<bool>(*impl_, timeout, [&](ReplyHandler<bool> reply) {
    return impl_->Call(protocol::DestroyReportingSession{reporterID}, 1, Typed(std::move(reply)));
  });
}

void Client::reporterID(int64_t reporterID, ReplyHandler<Validity> reply) {
  impl_->Call(protocol::ReporterIDValid{reporterID}, 1, Typed(std::move(reply)));
}
Result<Validity> Client::reporterID(int64_t reporterID, std::chrono::milliseconds timeout) {
  return Blocking<Validity>(*impl_, timeout, [&](ReplyHandler<Validity> reply) {
    return impl_->Call(protocol::ReporterIDValid{reporterID}, 1, Typed(std::move(reply)));
  });
}

void Client::getAllReporters(ReplyHandler<std::vector<int64_t>> reply) {
  impl_->Call(protocol::GetAllReporters{}, 1, Typed(std::move(reply)));
}
Result<std::vector<int64_t>> Client::getAllReporters(std::chrono::milliseconds timeout) {
  return Blocking<std::vector<int64_t>>(
      *impl_, timeout, [&](ReplyHandler<std::vector<int64_t>> reply) {
        return impl_->Call(protocol::GetAllReporters{}, 1, Typed(std::move(reply)));
      });
}

void Client::status(ReplyHandler<Dictionary> reply) {
  impl_->Call(protocol::GetStatus{}, 1, Typed(std::move(reply)));
}
Result<Dictionary> Client::status(std::chrono::milliseconds timeout) {
  return Blocking<Dictionary>(*impl_, timeout, [&](ReplyHandler<Dictionary> reply) {
    return impl_->Call(protocol::GetStatus{}, 1, Typed(std::move(reply)));
  });
}

void Client::killService(ReplyHandler<Done> reply) {
  impl_->Call(protocol::KillService{}, 0,
              [reply = std::move(reply)](Result<protocol::Reply> result) {
                if (!reply) return;
                if (result) {
                  reply(Done{});
                } else {
                  reply(result.error());
                }
              });
}
Result<Done> Client::killService(std::chrono::milliseconds timeout) {
  return Blocking<Done>(*impl_, timeout, [&](ReplyHandler<Done> reply) -> uint64_t {
    killService(std::move(reply));
    return 0;
  });
}

// Session ------------------------------------------------------------------------------------

struct Session::StartReply {
  Waiter<bool> waiter;
};

Session::Session(Client& client, int64_t reporterID, std::chrono::milliseconds timeout,
                 std::shared_ptr<StartReply> startReply)
    : client_(&client),
      reporterID_(reporterID),
      timeout_(timeout),
      startReply_(std::move(startReply)),
      running_(true) {}

Result<Session> Session::Open(Client& client, int64_t reporterID, const Options& options) {
  if (reporterID == 0) reporterID = NewReporterID();
  auto step = [&](const char* what, Result<bool> result) -> std::optional<Error> {
    if (result) return std::nullopt;
    Error error = result.error();
    error.message = fmt::format("{} of session {} failed: {}", what, reporterID, error.message);
    return error;
  };
  if (auto failed = step("creation", client.createReportingSession(reporterID, options.timeout))) {
    return std::move(*failed);
  }
  if (options.serviceType) {
    if (auto failed =
            step("setting the service type",
                 client.setServiceType(*options.serviceType, reporterID, options.timeout))) {
      return std::move(*failed);
    }
  }
  if (!options.configuration.empty()) {
    if (auto failed = step("configuration", client.setConfiguration(options.configuration,
                                                                    reporterID, options.timeout))) {
      return std::move(*failed);
    }
  }
  // The start's answer is held by the service until the stop; it is collected there.
  auto startReply = std::make_shared<StartReply>();
  client.startReportingSessionForID(
      reporterID, [startReply](Result<bool> result) { startReply->waiter.Set(std::move(result)); });
  return Session(client, reporterID, options.timeout, std::move(startReply));
}

Session::Session(Session&& other) noexcept
    : client_(std::exchange(other.client_, nullptr)),
      reporterID_(other.reporterID_),
      timeout_(other.timeout_),
      startReply_(std::move(other.startReply_)),
      running_(std::exchange(other.running_, false)),
      destroyed_(std::exchange(other.destroyed_, true)) {}

Session& Session::operator=(Session&& other) noexcept {
  if (this != &other) {
    if (client_) (void)destroy();
    client_ = std::exchange(other.client_, nullptr);
    reporterID_ = other.reporterID_;
    timeout_ = other.timeout_;
    startReply_ = std::move(other.startReply_);
    running_ = std::exchange(other.running_, false);
    destroyed_ = std::exchange(other.destroyed_, true);
  }
  return *this;
}

Session::~Session() {
  if (client_ && client_->connected()) (void)destroy();
}

Result<Done> Session::send(const Dictionary& message, uint32_t category, uint16_t type) {
  if (!client_) return MakeError(Errc::kInvalidArgument, "the session was moved from");
  return client_->sendMessage(message, category, type, std::vector<int64_t>{reporterID_});
}

Result<Done> Session::send(const Dictionary& message, uint32_t category, uint16_t type,
                           std::chrono::milliseconds timeout) {
  if (!client_) return MakeError(Errc::kInvalidArgument, "the session was moved from");
  return client_->sendMessage(message, category, type, std::vector<int64_t>{reporterID_}, timeout);
}

Result<Done> Session::stop() {
  if (!client_ || !running_) return Done{};
  running_ = false;
  auto stopped = client_->stopReportingSessionForID(reporterID_, timeout_);
  if (!stopped) return stopped.error();
  // The held start answer comes with the stop; a start that was answered at once is already in.
  std::unique_lock lock(startReply_->waiter.mutex);
  if (!startReply_->waiter.answered.wait_for(
          lock, timeout_, [&] { return startReply_->waiter.result.has_value(); })) {
    return MakeError(Errc::kTimedOut,
                     fmt::format("session {} stopped, but the answer to its start did not come "
                                 "within {} ms",
                                 reporterID_, timeout_.count()));
  }
  if (!*startReply_->waiter.result) return startReply_->waiter.result->error();
  return Done{};
}

Result<Done> Session::destroy() {
  if (!client_ || destroyed_) return Done{};
  auto stopped = stop();
  destroyed_ = true;
  auto destroyedReply = client_->destroyReportingSession(reporterID_, timeout_);
  if (!stopped) return stopped;
  if (!destroyedReply) return destroyedReply.error();
  return Done{};
}

}  // namespace tavrin::client
