#pragma once

// libtavrin: the client library of the tavrin reporting service.
//
// A Client is one connection to the service's socket. Every remote operation comes in up to three
// forms:
//   - asynchronous: the last argument is a reply handler, invoked on the client's reader thread
//     with the answer or an error;
//   - blocking: the last argument is a time-out; the call waits for the answer (never call these
//     from inside a reply handler: they answer Errc::kWouldDeadlock there);
//   - fire-and-forget (sendMessage only): no reply is asked for; the call returns once the request
//     is written.
// Requests of one client run on the service in the order they were made.
//
// Replies the service sends more than once or never:
//   - getServiceNameForReporterID with reporter ID 0 is answered twice; the asynchronous handler
//     is invoked twice, the blocking form returns the first answer.
//   - startReportingSessionForID on a session that is not running yet is answered only when the
//     session is stopped (stopReportingSessionForID), so the blocking form of a start would wait
//     until then; Session below starts asynchronously. A held start whose session goes away
//     before its stop (destroyed or replaced on this client) is never answered: its handler is
//     invoked with Errc::kNoReply once the destroy or the replacing create has been answered.
//   - killService is never answered: the service ends. Its handler is invoked once the connection
//     has closed.
// When the connection ends, every handler still waiting is invoked once with
// Errc::kConnectionLost; later calls fail at once with the same error.

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include <nlohmann/json.hpp>

namespace tavrin::client {

// Message payloads and configurations: string keys; values are null, booleans, integers, floats,
// strings, arrays and dictionaries. Insertion order is kept.
using Dictionary = nlohmann::ordered_json;

// The socket the service listens on unless TAVRIN_SOCKET or the caller names another one.
inline constexpr std::string_view kDefaultSocketPath = "/run/tavrin/reporting.sock";
// How long a blocking call waits unless told otherwise.
inline constexpr std::chrono::milliseconds kDefaultTimeout{5000};

enum class Errc {
  kNotRunning = 1,    // nothing listens on the socket (missing file, connection refused)
  kPermissionDenied,  // the socket exists but this user may not connect to it
  kConnectionLost,    // the connection ended (the service stopped, or Close() was called)
  kTimedOut,          // a blocking call's time-out passed before the answer came
  kNoReply,           // the service dropped the request: it will never be answered
  kOperationError,    // the operation answered with its own error (domain and code set)
  kRejected,          // the service did not understand the request (protocol error code set)
  kBadReply,          // the service answered something this library cannot read
  kWouldDeadlock,     // a blocking call made on the reader thread (inside a reply handler)
  kInvalidArgument,   // the request cannot be encoded (a value the protocol cannot carry)
};

std::string_view ErrcName(Errc code);

struct Error {
  Errc code = Errc::kConnectionLost;
  // kOperationError and kRejected: the service's error domain and code.
  std::string domain;
  int64_t serviceCode = 0;
  // What happened and, where there is something to do, what to do about it.
  std::string message;
};

// The answer of a call: a value, or an error.
template <typename T>
class [[nodiscard]] Result {
 public:
  Result(T value) : state_(std::move(value)) {}      // NOLINT(google-explicit-constructor)
  Result(Error error) : state_(std::move(error)) {}  // NOLINT(google-explicit-constructor)

  bool ok() const { return state_.index() == 0; }
  explicit operator bool() const { return ok(); }
  // Precondition: ok().
  T& value() { return std::get<0>(state_); }
  const T& value() const { return std::get<0>(state_); }
  // Precondition: !ok().
  const Error& error() const { return std::get<1>(state_); }

 private:
  std::variant<T, Error> state_;
};

// The value of an answer that carries none.
struct Done {
  bool operator==(const Done&) const = default;
};

// What reporterID() answers: the asked ID and the session's service type when some client holds
// a session under it, else reporter ID 0 and service type 0xFFFF.
struct Validity {
  int64_t reporterID = 0;
  uint16_t serviceType = 0xFFFF;
  bool operator==(const Validity&) const = default;
};

namespace detail {
class Connection;
}  // namespace detail

template <typename T>
using ReplyHandler = std::function<void(Result<T>)>;

struct ConnectOptions {
  // Empty: TAVRIN_SOCKET when it is set and not empty, else kDefaultSocketPath.
  std::string socketPath;
  // How long connecting may take.
  std::chrono::milliseconds timeout = kDefaultTimeout;
};

// The socket path a client connects to: `requested` when not empty, else TAVRIN_SOCKET, else the
// default.
std::string ResolveSocketPath(std::string_view requested = {});

// A fresh, random, non-zero reporter ID for a new session.
int64_t NewReporterID();

class Client {
 public:
  static Result<std::unique_ptr<Client>> Connect(const ConnectOptions& options = {});
  ~Client();  // Close()s
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  const std::string& socketPath() const;
  // False once the connection has ended.
  bool connected() const;
  // Ends the connection. Handlers still waiting are invoked with kConnectionLost before Close()
  // returns. Idempotent. Must not be called from a reply handler.
  void Close();
  // Requests sent whose answers (or whose second answer) are still awaited.
  size_t pendingCalls() const;

  // 1
  void createReportingSession(int64_t reporterID, ReplyHandler<bool> reply);
  Result<bool> createReportingSession(int64_t reporterID,
                                      std::chrono::milliseconds timeout = kDefaultTimeout);
  // 2
  void setServiceType(uint16_t serviceType, int64_t reporterID, ReplyHandler<bool> reply);
  Result<bool> setServiceType(uint16_t serviceType, int64_t reporterID,
                              std::chrono::milliseconds timeout = kDefaultTimeout);
  // 3: 0xFFFF when no client holds a session under the ID.
  void getServiceNameForReporterID(int64_t reporterID, ReplyHandler<uint16_t> reply);
  Result<uint16_t> getServiceNameForReporterID(int64_t reporterID,
                                               std::chrono::milliseconds timeout = kDefaultTimeout);
  // 4
  void setConfiguration(const Dictionary& configuration, int64_t reporterID,
                        ReplyHandler<bool> reply);
  Result<bool> setConfiguration(const Dictionary& configuration, int64_t reporterID,
                                std::chrono::milliseconds timeout = kDefaultTimeout);
  // 5: see the note at the top about the held answer.
  void startReportingSessionForID(int64_t reporterID, ReplyHandler<bool> reply);
  Result<bool> startReportingSessionForID(int64_t reporterID,
                                          std::chrono::milliseconds timeout = kDefaultTimeout);
  // 6: to the sessions named in `reporterIDs` (any client's), or, when there is no list, to every
  // running session of every client (with none running, the service records the message on its
  // own). Fails with kOperationError ("com.quorvex.audio.reporting", 1) while reporting
  // is disabled on the service.
  Result<Done> sendMessage(const Dictionary& message, uint32_t category, uint16_t type,
                           std::optional<std::vector<int64_t>> reporterIDs = std::nullopt);
  void sendMessage(const Dictionary& message, uint32_t category, uint16_t type,
                   std::optional<std::vector<int64_t>> reporterIDs, ReplyHandler<Done> reply);
  Result<Done> sendMessage(const Dictionary& message, uint32_t category, uint16_t type,
                           std::optional<std::vector<int64_t>> reporterIDs,
                           std::chrono::milliseconds timeout);
  // 7
  void stopReportingSessionForID(int64_t reporterID, ReplyHandler<bool> reply);
  Result<bool> stopReportingSessionForID(int64_t reporterID,
                                         std::chrono::milliseconds timeout = kDefaultTimeout);
  // 8
  void destroyReportingSession(int64_t reporterID, ReplyHandler<bool> reply);
  Result<bool> destroyReportingSession(int64_t reporterID,
                                       std::chrono::milliseconds timeout = kDefaultTimeout);
  // 9: whether some client holds a session under the ID.
  void reporterID(int64_t reporterID, ReplyHandler<Validity> reply);
  Result<Validity> reporterID(int64_t reporterID,
                              std::chrono::milliseconds timeout = kDefaultTimeout);
  // 10: the reporter IDs of every client's sessions.
  void getAllReporters(ReplyHandler<std::vector<int64_t>> reply);
  Result<std::vector<int64_t>> getAllReporters(std::chrono::milliseconds timeout = kDefaultTimeout);
  // 12: the service's counts and its message ledger (the protocol document lists the keys).
  void status(ReplyHandler<Dictionary> reply);
  Result<Dictionary> status(std::chrono::milliseconds timeout = kDefaultTimeout);
  // 11: ends the service process (exit status 2). Answered once the connection has closed.
  void killService(ReplyHandler<Done> reply);
  Result<Done> killService(std::chrono::milliseconds timeout = kDefaultTimeout);

 private:
  explicit Client(std::unique_ptr<detail::Connection> impl);
  std::unique_ptr<detail::Connection> impl_;
};

// One reporting session for the lifetime of the object: Open() creates it, sets its service type,
// gives it its configuration and starts it; the destructor stops and destroys it. Messages go to
// this session only.
class Session {
 public:
  struct Options {
    std::optional<uint16_t> serviceType;  // not set: the session keeps the service's default
    Dictionary configuration = Dictionary::object();
    std::chrono::milliseconds timeout = kDefaultTimeout;  // for each step, and for the stop
  };

  // reporterID 0 picks a fresh one (NewReporterID()).
  static Result<Session> Open(Client& client, int64_t reporterID, const Options& options);
  static Result<Session> Open(Client& client, int64_t reporterID = 0) {
    return Open(client, reporterID, Options{});
  }

  Session(Session&& other) noexcept;
  Session& operator=(Session&& other) noexcept;
  Session(const Session&) = delete;
  Session& operator=(const Session&) = delete;
  ~Session();  // Stop() and Destroy(), errors ignored (the connection may already be gone)

  int64_t reporterID() const { return reporterID_; }
  bool running() const { return running_; }

  // Fire-and-forget to this session.
  Result<Done> send(const Dictionary& message, uint32_t category, uint16_t type);
  // The same, waiting for the service's answer.
  Result<Done> send(const Dictionary& message, uint32_t category, uint16_t type,
                    std::chrono::milliseconds timeout);
  // Stops the session (its summary is written and its messages flushed) and waits for the stop's
  // answer and the start's held answer. Idempotent.
  Result<Done> stop();
  // stop(), then removes the session from the service. Idempotent.
  Result<Done> destroy();

 private:
  struct StartReply;
  Session(Client& client, int64_t reporterID, std::chrono::milliseconds timeout,
          std::shared_ptr<StartReply> startReply);

  Client* client_ = nullptr;
  int64_t reporterID_ = 0;
  std::chrono::milliseconds timeout_ = kDefaultTimeout;
  std::shared_ptr<StartReply> startReply_;
  bool running_ = false;
  bool destroyed_ = false;
};

}  // namespace tavrin::client
