#pragma once

#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include <asio.hpp>

#include "platform/ServiceListener.h"
#include "protocol/Codec.h"
#include "protocol/Frame.h"

namespace tavrin {

struct UnixListenerOptions {
  // Where to bind when the socket is not handed over by systemd.
  std::string socketPath;
  // Permission bits of the socket file (not reduced by the umask): owner and group only, so that a
  // local user gets in only by being put in the service's group.
  unsigned socketMode = 0660;
  uint32_t frameLimit = protocol::kDefaultFrameLimit;
  // Adopt a listening socket passed as descriptor 3 (LISTEN_FDS/LISTEN_PID) when there is one.
  bool allowSocketActivation = true;
  // Open connections of one peer uid; more are closed as they arrive, so one user cannot take
  // every descriptor.
  size_t connectionsPerUid = 256;
  // Reply bytes waiting for one client that does not read them; past this that client is cut off.
  size_t replyBytesPerConnection = 4 * 1024 * 1024;
  // Reply bytes waiting for all clients together; past this the connections with the largest
  // backlogs are cut off, so that many slow readers cannot exhaust the service's memory.
  size_t replyBytesTotal = 64 * 1024 * 1024;
  // Descriptors kept free for the service itself (store, settings, logs): new connections are
  // closed at once when accepting them would leave fewer.
  size_t reservedDescriptors = 64;
};

class UnixClientConnection;

// What the read gate says about reading the next request.
enum class ReadGate {
  kOpen,
  // The service falls behind: connections that send more than their share (their recent bytes
  // above the mean of all connections) wait; the others, round trips among them, go on.
  kHeavySendersWait,
  // The service is far behind: every connection waits.
  kAllWait,
};

// The service's listening socket: a unix-domain stream socket speaking the framed MessagePack
// protocol. One I/O thread — the one that calls Resume() — accepts connections, reads and decodes
// requests, calls the exported object and writes replies; replies may be produced on any thread.
//
// How a connection's end maps onto its handlers: every end runs the invalidation handler once;
// the interruption handler runs before it when the end was abnormal (the service closed the
// connection after an undecodable frame, or the stream ended inside a frame).
class UnixServiceListener final : public ServiceListener {
 public:
  explicit UnixServiceListener(UnixListenerOptions options);
  ~UnixServiceListener() override;
  UnixServiceListener(const UnixServiceListener&) = delete;
  UnixServiceListener& operator=(const UnixServiceListener&) = delete;

  // Adopts the socket-activation descriptor or binds options.socketPath (creating its directory,
  // replacing a stale socket file but never another kind of file or a live service's socket).
  // Throws std::system_error with a message that names the path.
  void Open();
  // True when Open() adopted a socket passed by systemd.
  bool SocketActivated() const { return socketActivated_; }
  const std::string& SocketPath() const { return options_.socketPath; }

  void SetDelegate(ServiceListenerDelegate* delegate) override;
  // Asked before each request is decoded, on the I/O thread; a connection that must wait leaves
  // its requests unread (its client sees the socket fill up and slows down) and asks again after
  // kReadGatePause. Set before Resume().
  void SetReadGate(std::function<ReadGate()> gate) { readGate_ = std::move(gate); }
  // What op 12 (status) answers, called on the I/O thread: it must be cheap and must not wait
  // for the work queue. Set before Resume(); without one, status is answered with an error.
  void SetStatusProvider(std::function<Dictionary()> provider) {
    statusProvider_ = std::move(provider);
  }
  // The refusal counts by limit, for the status.
  Dictionary RefusalsByLimit() const;
  // How fast recent traffic fades from a connection's share: bytes of the last few seconds count.
  static constexpr double kTrafficMemorySeconds = 1.0;
  // Short enough to add little latency once the gate opens, long enough not to spin the thread.
  static constexpr auto kReadGatePause = std::chrono::milliseconds(1);
  // Besides root and the service's own uid, the peers whose killService is honoured; anyone else
  // is answered with an access error and the service goes on. Thread-safe.
  void SetKillUids(std::vector<uint32_t> uids);
  bool MayKill(uint32_t uid) const;
  // The bounds a request is decoded against; thread-safe, applies to the next request read.
  void SetRequestLimits(const protocol::RequestLimits& limits);
  protocol::RequestLimits RequestLimits() const;
  // Requests refused for being over a request limit.
  uint64_t LimitRefusals() const { return limitRefusals_.load(std::memory_order_relaxed); }
  // Refusals counted under each limit of the protocol (requests over the sessions, reporter-list
  // and entries limits; connections over the per-uid limit; connections cut off for their reply
  // backlog, their own or the largest over the total).
  uint64_t RefusalsOver(protocol::LimitCode limit) const {
    const auto index = static_cast<size_t>(limit);
    return index < refusalsByLimit_.size() ? refusalsByLimit_[index].load() : 0;
  }
  // One line for the log: each limit's refusals by name.
  std::string RefusalCounts() const;
  // Connections closed on arrival: over the per-uid limit, or into the descriptor reserve.
  uint64_t ConnectionRefusals() const {
    return connectionRefusals_.load(std::memory_order_relaxed);
  }
  // Connections cut off for their reply backlog (their own, or the largest over the total).
  uint64_t BacklogCutoffs() const { return backlogCutoffs_.load(std::memory_order_relaxed); }
  // killService requests refused for the peer's uid.
  uint64_t KillRefusals() const { return killRefusals_.load(std::memory_order_relaxed); }
  // Times a connection found the gate closed.
  uint64_t ReadGateStalls() const { return readGateStalls_.load(std::memory_order_relaxed); }
  // Frames longer than this are decoded on the listener's decode thread instead of the I/O
  // thread: a request of a few hundred bytes costs less to decode than to hand over, while one
  // near the frame limit could hold every other connection's replies for milliseconds.
  static constexpr size_t kInlineDecodeBytes = 16 * 1024;
  // Reply frames one write hands to the kernel at most: asio's gathered write takes 64 buffers
  // a system call, and a connection's replies need no more to keep up with its requests.
  static constexpr size_t kMaxFramesPerWrite = 64;
  // Runs the I/O loop on the calling thread until Stop().
  void Resume() override;
  // Thread-safe; makes Resume() return. Connections are closed.
  void Stop();

  // The I/O loop, for other watchers that want to run on the listener's thread.
  asio::io_context& Io() { return io_; }

 private:
  friend class UnixClientConnection;
  void StartAccept();
  void Forget(const std::shared_ptr<UnixClientConnection>& connection);
  // Why a connection from `uid` may not be kept, or nothing when it may. I/O thread.
  std::optional<std::string> RefusalOf(uint32_t uid);
  void CountRefusal(protocol::LimitCode limit);
  // Counts one refused connection or failed accept, with at most one log line per second.
  void NoteRefusal(const std::string& why);
  // Cuts off the connections with the largest reply backlogs until the total fits. I/O thread.
  void ShedLargestBacklogs();

  UnixListenerOptions options_;
  asio::io_context io_;
  // Destroyed before io_: a decode that finishes posts its result to io_.
  asio::thread_pool decodePool_{1};
  asio::local::stream_protocol::acceptor acceptor_;
  // Whether a connection whose recent traffic is `connectionRate` may read now. I/O thread.
  bool MayRead(double connectionRate);
  // Adds `bytes` read now to the listener's recent traffic and returns it decayed to now.
  double AddTraffic(double bytes);

  ServiceListenerDelegate* delegate_ = nullptr;
  std::function<ReadGate()> readGate_;
  std::function<Dictionary()> statusProvider_;
  double recentTraffic_ = 0;  // I/O thread: decayed bytes of all connections
  std::chrono::steady_clock::time_point trafficStamp_{};
  std::atomic<uint64_t> readGateStalls_{0};
  mutable std::mutex killUidsMutex_;
  std::vector<uint32_t> killUids_;  // guarded by killUidsMutex_
  std::atomic<uint64_t> killRefusals_{0};
  std::atomic<uint64_t> entriesPerFrame_{protocol::RequestLimits::kDefaultEntriesPerFrame};
  std::atomic<uint64_t> reporterIDsPerMessage_{
      protocol::RequestLimits::kDefaultReporterIDsPerMessage};
  std::atomic<uint64_t> sessionsPerConnection_{
      protocol::RequestLimits::kDefaultSessionsPerConnection};
  std::atomic<uint64_t> limitRefusals_{0};
  std::array<std::atomic<uint64_t>, 6> refusalsByLimit_{};  // by LimitCode
  std::atomic<uint64_t> connectionRefusals_{0};
  std::atomic<uint64_t> backlogCutoffs_{0};
  size_t descriptorLimit_ = 0;         // RLIMIT_NOFILE at Open()
  size_t totalPendingReplyBytes_ = 0;  // I/O thread
  uint64_t refusalsSinceLog_ = 0;      // I/O thread
  std::chrono::steady_clock::time_point lastRefusalLog_{};
  bool socketActivated_ = false;
  bool boundPath_ = false;
  mutable std::mutex connectionsMutex_;
  std::set<std::shared_ptr<UnixClientConnection>> connections_;  // guarded by connectionsMutex_
};

}  // namespace tavrin
