#include "platform/linux/socket/UnixServiceListener.h"

#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cmath>
#include <deque>
#include <filesystem>
#include <system_error>
#include <unordered_set>

#include "platform/LogSystem.h"
#include "protocol/Codec.h"
#include "protocol/Dispatch.h"

namespace tavrin {
namespace {

using Socket = asio::local::stream_protocol::socket;

// Bytes read from a socket per system call.
constexpr size_t kReadChunk = 16 * 1024;
constexpr int kListenBacklog = 128;
// Pause after a failed accept (EMFILE and the like) before trying again.
constexpr auto kAcceptRetryDelay = std::chrono::milliseconds(100);
// `value` faded over `elapsed` with the listener's traffic memory.
double Decayed(double value, std::chrono::steady_clock::duration elapsed) {
  const double seconds = std::chrono::duration<double>(elapsed).count();
  return value * std::exp(-seconds / UnixServiceListener::kTrafficMemorySeconds);
}
// Refused connections and failed accepts come in crowds: one line per interval, with the count.
constexpr auto kRefusalLogInterval = std::chrono::seconds(1);

std::system_error PathError(int error, const std::string& what, const std::string& path) {
  return std::system_error(error, std::generic_category(), what + " " + path);
}

// True when something accepts connections at `path` (a live service).
bool SomeoneListensAt(const std::string& path) {
  asio::io_context io;
  Socket probe(io);
  asio::error_code error;
  probe.connect(asio::local::stream_protocol::endpoint(path), error);
  return !error;
}

}  // namespace

// One client connection. Lives in the listener's set until it has ended; reply senders hold it
// weakly, so a reply produced after the end is dropped.
class UnixClientConnection final : public ClientConnection,
                                   public std::enable_shared_from_this<UnixClientConnection> {
 public:
  UnixClientConnection(UnixServiceListener& listener, Socket socket, uint32_t frameLimit)
      : listener_(listener),
        socket_(std::move(socket)),
        reader_(frameLimit),
        gateTimer_(socket_.get_executor()) {
    ucred credentials{};
    socklen_t size = sizeof(credentials);
    if (getsockopt(socket_.native_handle(), SOL_SOCKET, SO_PEERCRED, &credentials, &size) == 0) {
      pid_ = credentials.pid;
      uid_ = credentials.uid;
    }
  }

  int32_t ProcessIdentifier() const override { return pid_; }
  uint32_t UserIdentifier() const override { return uid_; }
  void SetExportedInterface(std::string_view name) override { interface_ = std::string(name); }
  void SetExportedObject(std::shared_ptr<RuvoReportingServiceProtocol> object) override {
    object_ = std::move(object);
  }
  std::shared_ptr<RuvoReportingServiceProtocol> ExportedObject() const override { return object_; }
  void SetInterruptionHandler(std::function<void()> handler) override {
    interruption_ = std::move(handler);
  }
  void SetInvalidationHandler(std::function<void()> handler) override {
    invalidation_ = std::move(handler);
  }
  void Resume() override {
    if (resumed_) return;
    resumed_ = true;
    Read();
  }
  std::string Description() const override {
    return fmt::format("<connection from pid {} uid {} to {}>", pid_, uid_,
                       interface_.empty() ? "(no interface)" : interface_);
  }

  // Queues one reply frame; any thread.
  void Send(std::vector<uint8_t> body) {
    std::vector<uint8_t> frame = protocol::EncodeFrame(body);
    asio::post(socket_.get_executor(),
               [self = shared_from_this(), frame = std::move(frame)]() mutable {
                 self->QueueWrite(std::move(frame));
               });
  }

  // Ends the connection from the service's side (shutdown of the listener).
  void Close() { End(/*abnormal=*/false, "service stopping"); }
  // Closes a connection refused on arrival: nobody has seen it, so no handler runs.
  void CloseUnaccepted() {
    ended_ = true;
    asio::error_code ignored;
    socket_.close(ignored);
  }

  size_t PendingBytes() const { return pendingBytes_; }
  uint32_t Uid() const { return uid_; }
  bool Ended() const { return ended_; }
  // Ends the connection because the replies waiting for all clients exceed their bound and this
  // one waits for the most.
  void CutOffForTotalBacklog() {
    TLOG_ERROR(nullptr,
               "closing connection of pid {}: the largest reply backlog ({} bytes) while replies "
               "for all clients exceed {} bytes",
               pid_, pendingBytes_, listener_.options_.replyBytesTotal);
    listener_.backlogCutoffs_.fetch_add(1, std::memory_order_relaxed);
    listener_.CountRefusal(protocol::LimitCode::kReplyBacklog);
    End(/*abnormal=*/true, "reply backlog over the total");
  }

 private:
  void Read() {
    socket_.async_read_some(asio::buffer(buffer_), [self = shared_from_this()](
                                                       const asio::error_code& error, size_t size) {
      self->OnRead(error, size);
    });
  }

  void OnRead(const asio::error_code& error, size_t size) {
    if (ended_) return;
    if (error) {
      // A stream that ends between frames is an ordinary goodbye; inside a frame it is not.
      const bool insideFrame = reader_.InsideFrame();
      End(insideFrame, insideFrame ? "stream ended inside a frame" : error.message());
      return;
    }
    reader_.Append(std::span<const uint8_t>(buffer_.data(), size));
    HandleFrames();
  }

  // Handles the complete frames received so far, then reads more; pauses while the read gate is
  // closed, leaving the rest in the reader.
  void HandleFrames() {
    for (;;) {
      if (!listener_.MayRead(RecentTraffic(0))) {
        if (auto status = PeekStatusRequest()) {
          reader_.Next();
          HandleRequest(std::move(*status));
          continue;
        }
        listener_.readGateStalls_.fetch_add(1, std::memory_order_relaxed);
        if (reader_.Buffered() == 0) {
          // Nothing of this connection is held yet: reading on holds at most one buffer of it,
          // and lets a status request in.
          Read();
          return;
        }
        gateTimer_.expires_after(UnixServiceListener::kReadGatePause);
        gateTimer_.async_wait([self = shared_from_this()](const asio::error_code& error) {
          if (!error && !self->ended_) self->HandleFrames();
        });
        return;
      }
      const auto status = reader_.Next();
      if (status == protocol::FrameReader::Status::kNeedMore) break;
      if (status == protocol::FrameReader::Status::kBadLength) {
        TLOG_ERROR(nullptr, "closing connection of pid {}: frame length {} outside 1..{}", pid_,
                   reader_.BadLength(), reader_.FrameLimit());
        End(/*abnormal=*/true, "bad frame length");
        return;
      }
      const auto body = reader_.Body();
      RecentTraffic(static_cast<double>(body.size() + protocol::kFrameHeaderSize));
      if (body.size() > UnixServiceListener::kInlineDecodeBytes) {
        DecodeAside(std::vector<uint8_t>(body.begin(), body.end()));
        return;
      }
      if (!HandleRequest(protocol::DecodeRequest(body, listener_.RequestLimits()))) return;
    }
    Read();
  }

  // A status request next in line is answered even while the read gate holds this connection:
  // it costs the work queue nothing, and a stall is when an operator asks for one.
  std::optional<protocol::Request> PeekStatusRequest() {
    constexpr size_t kMaxStatusRequestBytes = 32;  // a call number and the operation
    const auto body = reader_.Peek();
    if (body.empty() || body.size() > kMaxStatusRequestBytes) return std::nullopt;
    auto decoded = protocol::DecodeRequest(body, listener_.RequestLimits());
    auto* request = std::get_if<protocol::Request>(&decoded);
    if (!request || !std::holds_alternative<protocol::GetStatus>(request->arguments)) {
      return std::nullopt;
    }
    return std::move(*request);
  }

  // Decodes a large frame on the listener's decode thread, so that other connections' requests
  // and replies do not wait for it; this connection reads nothing more until it is handled, which
  // keeps its requests in order.
  void DecodeAside(std::vector<uint8_t> body) {
    asio::post(listener_.decodePool_, [self = shared_from_this(), body = std::move(body),
                                       limits = listener_.RequestLimits()]() mutable {
      auto decoded = protocol::DecodeRequest(body, limits);
      asio::post(self->socket_.get_executor(), [self, decoded = std::move(decoded)]() mutable {
        if (self->ended_) return;
        if (self->HandleRequest(std::move(decoded))) self->HandleFrames();
      });
    });
  }

  // This connection's recent bytes, decayed to now, after adding `bytes`; the listener's total
  // is kept in step, so that the two compare.
  double RecentTraffic(double bytes) {
    const auto now = std::chrono::steady_clock::now();
    recentTraffic_ = Decayed(recentTraffic_, now - trafficStamp_) + bytes;
    trafficStamp_ = now;
    if (bytes > 0) listener_.AddTraffic(bytes);
    return recentTraffic_;
  }

  // False when the frame ended the connection.
  bool HandleRequest(std::variant<protocol::Request, protocol::RequestError> decoded) {
    if (auto* error = std::get_if<protocol::RequestError>(&decoded)) {
      if (error->kind == protocol::RequestError::Kind::kOverLimit) {
        RefuseOverLimit(*error);
        return true;
      }
      if (error->kind == protocol::RequestError::Kind::kCloseConnection) {
        TLOG_ERROR(nullptr, "closing connection of pid {}: undecodable request: {}", pid_,
                   error->reason);
        End(/*abnormal=*/true, "undecodable request");
        return false;
      }
      TLOG_INFO(nullptr, "rejected request from pid {}: code {}: {}", pid_,
                static_cast<int64_t>(error->code), error->reason);
      if (auto reply = protocol::EncodeRejectReply(*error)) Send(std::move(*reply));
      return true;
    }
    auto& request = std::get<protocol::Request>(decoded);
    if (std::holds_alternative<protocol::KillService>(request.arguments) &&
        !listener_.MayKill(uid_)) {
      listener_.killRefusals_.fetch_add(1, std::memory_order_relaxed);
      TLOG_ERROR(nullptr, "refused killService from pid {} uid {}: not allowed", pid_, uid_);
      if (request.call) {
        Send(protocol::EncodeOperationErrorReply(
            *request.call, protocol::kAccessErrorDomain, protocol::kKillNotAllowedCode,
            "killService is allowed only to root, the service's user and limits.kill_uids"));
      }
      return true;
    }
    if (std::holds_alternative<protocol::GetStatus>(request.arguments) &&
        listener_.statusProvider_) {
      if (request.call) {
        Send(protocol::EncodeDictionaryReply(*request.call, listener_.statusProvider_()));
      }
      return true;
    }
    if (!TrackSessions(request)) return true;
    std::shared_ptr<RuvoReportingServiceProtocol> object = object_;
    if (!object) return true;
    std::weak_ptr<UnixClientConnection> weakSelf = weak_from_this();
    protocol::Dispatch(std::move(request), *object, [weakSelf](std::vector<uint8_t> reply) {
      if (auto self = weakSelf.lock()) self->Send(std::move(reply));
    });
    return !ended_;
  }

  // Answers a request over a limit; the request has no other effect.
  void RefuseOverLimit(const protocol::RequestError& error) {
    listener_.limitRefusals_.fetch_add(1, std::memory_order_relaxed);
    listener_.CountRefusal(error.limit);
    ++limitRefusals_;
    TLOG_ERROR(nullptr, "refused request from pid {} uid {}: limit {}: {} ({} from this client)",
               pid_, uid_, static_cast<int64_t>(error.limit), error.reason, limitRefusals_);
    if (auto reply = protocol::EncodeRejectReply(error)) Send(std::move(*reply));
  }

  // Keeps the reporter IDs this connection's sessions live under, as the service's session map
  // for the client does: creating adds or replaces, destroying removes (ID 0 is never removed).
  // False when a new session would be over the limit; it has been refused then.
  bool TrackSessions(const protocol::Request& request) {
    if (const auto* create = std::get_if<protocol::CreateReportingSession>(&request.arguments)) {
      if (!sessionIDs_.contains(create->reporterID) &&
          sessionIDs_.size() >= listener_.sessionsPerConnection_.load(std::memory_order_relaxed)) {
        RefuseOverLimit({protocol::RequestError::Kind::kOverLimit, request.call,
                         protocol::RejectCode::kUnknownOp,
                         fmt::format("this connection already has {} sessions, the most it may "
                                     "keep (limits.sessions_per_connection); destroy one first",
                                     sessionIDs_.size()),
                         protocol::LimitCode::kSessionsPerConnection});
        return false;
      }
      sessionIDs_.insert(create->reporterID);
    } else if (const auto* destroy =
                   std::get_if<protocol::DestroyReportingSession>(&request.arguments)) {
      if (destroy->reporterID != 0) sessionIDs_.erase(destroy->reporterID);
    }
    return true;
  }

  void QueueWrite(std::vector<uint8_t> frame) {
    if (ended_) return;
    AddPending(static_cast<int64_t>(frame.size()));
    if (pendingBytes_ > listener_.options_.replyBytesPerConnection) {
      TLOG_ERROR(nullptr, "closing connection of pid {}: {} bytes of replies not read", pid_,
                 pendingBytes_);
      listener_.backlogCutoffs_.fetch_add(1, std::memory_order_relaxed);
      listener_.CountRefusal(protocol::LimitCode::kReplyBacklog);
      End(/*abnormal=*/true, "replies not read");
      return;
    }
    writes_.push_back(std::move(frame));
    if (!writing_) WriteNext();
    if (listener_.totalPendingReplyBytes_ > listener_.options_.replyBytesTotal) {
      listener_.ShedLargestBacklogs();
    }
  }

  // Writes the queued reply frames, up to kMaxFramesPerWrite, in one gathered write. One frame a
  // write let a client's replies pile up while the I/O thread served a flooding connection: it
  // got one reply out per turn of the loop, however many were waiting.
  void WriteNext() {
    if (writes_.empty() || ended_) {
      writing_ = false;
      return;
    }
    writing_ = true;
    const size_t count = std::min(writes_.size(), UnixServiceListener::kMaxFramesPerWrite);
    std::vector<asio::const_buffer> buffers;
    buffers.reserve(count);
    for (size_t i = 0; i < count; ++i) buffers.push_back(asio::buffer(writes_[i]));
    asio::async_write(socket_, buffers,
                      [self = shared_from_this(), count](const asio::error_code& error, size_t) {
                        if (self->ended_) return;
                        int64_t written = 0;
                        for (size_t i = 0; i < count; ++i) {
                          written += static_cast<int64_t>(self->writes_.front().size());
                          self->writes_.pop_front();
                        }
                        self->AddPending(-written);
                        if (error) {
                          // A client that left without reading its replies: the read side
                          // reports the end.
                          self->writing_ = false;
                          self->writes_.clear();
                          self->AddPending(-static_cast<int64_t>(self->pendingBytes_));
                          return;
                        }
                        self->WriteNext();
                      });
  }

  void End(bool abnormal, std::string_view why) {
    if (ended_) return;
    ended_ = true;
    TLOG_DEBUG(nullptr, "connection of pid {} ended: {}", pid_, why);
    asio::error_code ignored;
    socket_.shutdown(Socket::shutdown_both, ignored);
    socket_.close(ignored);
    gateTimer_.cancel();
    auto self = shared_from_this();
    if (abnormal && interruption_) interruption_();
    if (invalidation_) invalidation_();
    interruption_ = nullptr;
    invalidation_ = nullptr;
    object_.reset();
    writes_.clear();
    AddPending(-static_cast<int64_t>(pendingBytes_));
    listener_.Forget(self);
  }

  // Keeps this connection's backlog and the listener's total in step. I/O thread.
  void AddPending(int64_t bytes) {
    pendingBytes_ = static_cast<size_t>(static_cast<int64_t>(pendingBytes_) + bytes);
    listener_.totalPendingReplyBytes_ =
        static_cast<size_t>(static_cast<int64_t>(listener_.totalPendingReplyBytes_) + bytes);
  }

  UnixServiceListener& listener_;
  Socket socket_;
  protocol::FrameReader reader_;
  asio::steady_timer gateTimer_;
  double recentTraffic_ = 0;
  std::chrono::steady_clock::time_point trafficStamp_{};
  std::array<uint8_t, kReadChunk> buffer_{};
  int32_t pid_ = 0;
  uint32_t uid_ = 0;
  std::string interface_;
  std::shared_ptr<RuvoReportingServiceProtocol> object_;
  std::function<void()> interruption_;
  std::function<void()> invalidation_;
  bool resumed_ = false;
  bool ended_ = false;
  std::unordered_set<int64_t> sessionIDs_;  // I/O thread
  uint64_t limitRefusals_ = 0;              // I/O thread
  // Write side, I/O thread only.
  std::deque<std::vector<uint8_t>> writes_;
  size_t pendingBytes_ = 0;
  bool writing_ = false;
};

UnixServiceListener::UnixServiceListener(UnixListenerOptions options)
    : options_(std::move(options)), acceptor_(io_) {
  asio::post(decodePool_, [] { pthread_setname_np(pthread_self(), "tavrin-decode"); });
}

UnixServiceListener::~UnixServiceListener() {
  Stop();
  asio::error_code ignored;
  acceptor_.close(ignored);
  if (boundPath_) ::unlink(options_.socketPath.c_str());
}

void UnixServiceListener::Open() {
  rlimit descriptors{};
  if (::getrlimit(RLIMIT_NOFILE, &descriptors) == 0 && descriptors.rlim_cur != RLIM_INFINITY) {
    descriptorLimit_ = static_cast<size_t>(descriptors.rlim_cur);
  }
  if (options_.allowSocketActivation) {
    const int count = sd_listen_fds(/*unset_environment=*/1);
    if (count > 0) {
      const int fd = SD_LISTEN_FDS_START;
      if (sd_is_socket_unix(fd, SOCK_STREAM, /*listening=*/1, nullptr, 0) <= 0) {
        throw std::system_error(EINVAL, std::generic_category(),
                                "descriptor 3 passed by the service manager is not a listening "
                                "unix stream socket");
      }
      acceptor_.assign(asio::local::stream_protocol(), fd);
      socketActivated_ = true;
      return;
    }
  }

  const std::string& path = options_.socketPath;
  if (path.empty()) throw std::system_error(EINVAL, std::generic_category(), "no socket path");
  if (path.size() >= sizeof(sockaddr_un::sun_path)) {
    throw PathError(ENAMETOOLONG, "socket path too long:", path);
  }
  std::error_code fsError;
  const std::filesystem::path parent = std::filesystem::path(path).parent_path();
  if (!parent.empty()) {
    std::filesystem::create_directories(parent, fsError);
    if (fsError) throw PathError(fsError.value(), "cannot create the directory of", path);
  }
  struct stat existing {};
  if (::lstat(path.c_str(), &existing) == 0) {
    if (!S_ISSOCK(existing.st_mode)) {
      throw PathError(EEXIST, "refusing to replace a file that is not a socket:", path);
    }
    if (SomeoneListensAt(path)) throw PathError(EADDRINUSE, "another service listens at", path);
    ::unlink(path.c_str());  // a stale socket of a service that is gone
  }

  asio::error_code error;
  acceptor_.open(asio::local::stream_protocol(), error);
  if (!error) acceptor_.bind(asio::local::stream_protocol::endpoint(path), error);
  if (error) throw PathError(error.value(), "cannot bind", path);
  boundPath_ = true;
  if (::chmod(path.c_str(), options_.socketMode) != 0) {
    throw PathError(errno, "cannot set the mode of", path);
  }
  acceptor_.listen(kListenBacklog, error);
  if (error) throw PathError(error.value(), "cannot listen on", path);
}

void UnixServiceListener::SetDelegate(ServiceListenerDelegate* delegate) { delegate_ = delegate; }

void UnixServiceListener::Resume() {
  StartAccept();
  io_.run();
}

void UnixServiceListener::Stop() {
  asio::post(io_, [this] {
    asio::error_code ignored;
    acceptor_.cancel(ignored);
    std::set<std::shared_ptr<UnixClientConnection>> open;
    {
      std::lock_guard lock(connectionsMutex_);
      open = connections_;
    }
    for (const auto& connection : open) connection->Close();
    io_.stop();
  });
}

bool UnixServiceListener::MayRead(double connectionRate) {
  const ReadGate gate = readGate_ ? readGate_() : ReadGate::kOpen;
  if (gate == ReadGate::kOpen) return true;
  if (gate == ReadGate::kAllWait) return false;
  size_t connections;
  {
    std::lock_guard lock(connectionsMutex_);
    connections = connections_.size();
  }
  return connectionRate * static_cast<double>(connections) <= AddTraffic(0);
}

double UnixServiceListener::AddTraffic(double bytes) {
  const auto now = std::chrono::steady_clock::now();
  recentTraffic_ = Decayed(recentTraffic_, now - trafficStamp_) + bytes;
  trafficStamp_ = now;
  return recentTraffic_;
}

void UnixServiceListener::SetKillUids(std::vector<uint32_t> uids) {
  std::lock_guard lock(killUidsMutex_);
  killUids_ = std::move(uids);
}

void UnixServiceListener::SetRequestLimits(const protocol::RequestLimits& limits) {
  entriesPerFrame_.store(limits.entriesPerFrame, std::memory_order_relaxed);
  reporterIDsPerMessage_.store(limits.reporterIDsPerMessage, std::memory_order_relaxed);
  sessionsPerConnection_.store(limits.sessionsPerConnection, std::memory_order_relaxed);
}

protocol::RequestLimits UnixServiceListener::RequestLimits() const {
  return protocol::RequestLimits{entriesPerFrame_.load(std::memory_order_relaxed),
                                 reporterIDsPerMessage_.load(std::memory_order_relaxed),
                                 sessionsPerConnection_.load(std::memory_order_relaxed)};
}

bool UnixServiceListener::MayKill(uint32_t uid) const {
  if (uid == 0 || uid == ::geteuid()) return true;
  std::lock_guard lock(killUidsMutex_);
  return std::find(killUids_.begin(), killUids_.end(), uid) != killUids_.end();
}

void UnixServiceListener::StartAccept() {
  acceptor_.async_accept([this](const asio::error_code& error, Socket socket) {
    if (error == asio::error::operation_aborted) return;
    if (!error) {
      auto connection =
          std::make_shared<UnixClientConnection>(*this, std::move(socket), options_.frameLimit);
      if (auto refusal = RefusalOf(connection->Uid())) {
        NoteRefusal(*refusal);
        connection->CloseUnaccepted();
        StartAccept();
        return;
      }
      {
        std::lock_guard lock(connectionsMutex_);
        connections_.insert(connection);
      }
      const bool accepted =
          delegate_ != nullptr && delegate_->shouldAcceptNewConnection(*this, connection);
      if (!accepted) {
        connection->Close();
      }
      StartAccept();
      return;
    }
    // Out of descriptors or memory: retry a little later instead of spinning.
    NoteRefusal("accept failed: " + error.message());
    auto retry = std::make_shared<asio::steady_timer>(io_, kAcceptRetryDelay);
    retry->async_wait([this, retry](const asio::error_code& waitError) {
      if (!waitError) StartAccept();
    });
  });
}

std::optional<std::string> UnixServiceListener::RefusalOf(uint32_t uid) {
  std::lock_guard lock(connectionsMutex_);
  if (descriptorLimit_ > 0 &&
      connections_.size() + options_.reservedDescriptors >= descriptorLimit_) {
    return fmt::format(
        "connection of uid {} closed: {} connections leave only the {} descriptors "
        "kept for the service",
        uid, connections_.size(), options_.reservedDescriptors);
  }
  const auto sameUid = std::count_if(connections_.begin(), connections_.end(),
                                     [uid](const auto& c) { return c->Uid() == uid; });
  if (static_cast<size_t>(sameUid) >= options_.connectionsPerUid) {
    CountRefusal(protocol::LimitCode::kConnectionsPerUid);
    return fmt::format("connection of uid {} closed: it has {} open, the limit", uid, sameUid);
  }
  return std::nullopt;
}

void UnixServiceListener::CountRefusal(protocol::LimitCode limit) {
  const auto index = static_cast<size_t>(limit);
  if (index < refusalsByLimit_.size()) refusalsByLimit_[index].fetch_add(1);
}

std::string UnixServiceListener::RefusalCounts() const {
  using protocol::LimitCode;
  return fmt::format(
      "sessions per connection {}, reporter IDs per message {}, entries per frame {}, "
      "connections per uid {}, reply backlog {}",
      RefusalsOver(LimitCode::kSessionsPerConnection),
      RefusalsOver(LimitCode::kReporterListTooLong), RefusalsOver(LimitCode::kEntriesPerFrame),
      RefusalsOver(LimitCode::kConnectionsPerUid), RefusalsOver(LimitCode::kReplyBacklog));
}

Dictionary UnixServiceListener::RefusalsByLimit() const {
  using protocol::LimitCode;
  return Dictionary{{"sessions_per_connection", RefusalsOver(LimitCode::kSessionsPerConnection)},
                    {"reporter_ids_per_message", RefusalsOver(LimitCode::kReporterListTooLong)},
                    {"entries_per_frame", RefusalsOver(LimitCode::kEntriesPerFrame)},
                    {"connections_per_uid", RefusalsOver(LimitCode::kConnectionsPerUid)},
                    {"reply_backlog", RefusalsOver(LimitCode::kReplyBacklog)}};
}

void UnixServiceListener::NoteRefusal(const std::string& why) {
  connectionRefusals_.fetch_add(1, std::memory_order_relaxed);
  ++refusalsSinceLog_;
  const auto now = std::chrono::steady_clock::now();
  if (now - lastRefusalLog_ < kRefusalLogInterval) return;
  TLOG_ERROR(nullptr, "{} ({} refused or failed since the last such line)", why, refusalsSinceLog_);
  refusalsSinceLog_ = 0;
  lastRefusalLog_ = now;
}

void UnixServiceListener::ShedLargestBacklogs() {
  while (totalPendingReplyBytes_ > options_.replyBytesTotal) {
    std::shared_ptr<UnixClientConnection> largest;
    {
      std::lock_guard lock(connectionsMutex_);
      for (const auto& connection : connections_) {
        if (!connection->Ended() &&
            (!largest || connection->PendingBytes() > largest->PendingBytes())) {
          largest = connection;
        }
      }
    }
    if (!largest || largest->PendingBytes() == 0) return;
    largest->CutOffForTotalBacklog();
  }
}

void UnixServiceListener::Forget(const std::shared_ptr<UnixClientConnection>& connection) {
  std::lock_guard lock(connectionsMutex_);
  connections_.erase(connection);
}

}  // namespace tavrin
