#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "base/Dictionary.h"
#include "base/Error.h"
#include "platform/TelvoroSession.h"

namespace tavrin::testing {

class FakeTelvoroService;

// One message handed to a back-end.
struct FakeTelvoroMessage {
  uint16_t category = 0;
  uint16_t type = 0;
  Dictionary payload;
};

// A TelvoroSession that records what it is given. Its discovery answer follows the mode its
// service had when the session was created. Thread-safe; callbacks run outside its lock.
class FakeTelvoroSession final : public TelvoroSession {
 public:
  FakeTelvoroSession(FakeTelvoroService& service, size_t index, Dictionary sessionInfo,
                     Dictionary userInfo, std::vector<std::string> frameworksToCheck);

  void StartConfiguration(std::function<void(const BackendList&)> done) override;
  bool SendSessionMessage(uint16_t category, uint16_t type, const Dictionary& payload,
                          Error* error) override;
  void FlushMessages(std::function<void(const OptionalError&)> done) override;
  std::string Description() const override;

  // Answers a discovery that is still waiting (answer-later and never-answer modes). False when
  // there is none, or it was answered already.
  bool AnswerDiscovery(const BackendList& backends);
  bool DiscoveryPending() const;
  size_t StartConfigurationCalls() const;

  size_t Index() const { return index_; }
  const Dictionary& SessionInfo() const { return sessionInfo_; }
  const Dictionary& UserInfo() const { return userInfo_; }
  const std::vector<std::string>& FrameworksToCheck() const { return frameworks_; }
  // Messages accepted, in the order they arrived (refused ones are not kept).
  std::vector<FakeTelvoroMessage> Messages() const;
  size_t RefusedCount() const;
  size_t FlushCount() const;
  // How many messages had arrived when each flush was asked.
  std::vector<size_t> MessagesAtFlush() const;

 private:
  FakeTelvoroService& service_;
  const size_t index_;
  const Dictionary sessionInfo_;
  const Dictionary userInfo_;
  const std::vector<std::string> frameworks_;

  mutable std::mutex mutex_;
  std::function<void(const BackendList&)> pendingDiscovery_;  // guarded by mutex_
  size_t startConfigurationCalls_ = 0;                        // guarded by mutex_
  std::vector<FakeTelvoroMessage> messages_;                  // guarded by mutex_
  size_t refused_ = 0;                                        // guarded by mutex_
  std::vector<size_t> messagesAtFlush_;                       // guarded by mutex_
};

// The reporting back-ends, in memory: tokens, sessions, single messages, with a scriptable
// discovery answer and injectable send and flush failures. Thread-safe.
class FakeTelvoroService final : public TelvoroService {
 public:
  enum class Discovery {
    kAnswerAtOnce,  // StartConfiguration calls back before it returns, with Backends()
    kAnswerLater,   // held until the test calls AnswerDiscovery
    kAnswerNil,     // calls back at once with no back-ends
    kNeverAnswer,   // held; nothing answers unless the test does
  };

  struct SingleMessage {
    Dictionary sessionInfo;
    Dictionary userInfo;
    uint16_t category = 0;
    uint16_t type = 0;
    Dictionary payload;
  };

  static constexpr const char* kErrorDomain = "com.quorvex.tavrin.fake.telvoro";
  static constexpr uint64_t kFirstToken = 1000;

  void SetDiscovery(Discovery mode);
  Discovery DiscoveryMode() const;
  void SetBackends(std::vector<std::string> backends);
  std::vector<std::string> Backends() const;
  // Answers every discovery still waiting; returns how many were answered.
  size_t AnswerPendingDiscoveries(const BackendList& backends);

  // Sends (session and single) fail with `error` while set.
  void FailSends(OptionalError error);
  // Flushes call back with `error` while set.
  void FailFlushes(OptionalError error);

  // Tokens handed out, in order, with the parent each was asked for (null for none).
  std::vector<TelvoroTokenPtr> Tokens() const;
  std::vector<TelvoroTokenPtr> TokenParents() const;
  std::vector<std::shared_ptr<FakeTelvoroSession>> Sessions() const;
  std::shared_ptr<FakeTelvoroSession> LastSession() const;
  std::vector<SingleMessage> SingleMessages() const;
  size_t RefusedSingleMessages() const;

  // TelvoroService
  TelvoroTokenPtr NewSecureHierarchyToken(const TelvoroTokenPtr& parent) override;
  TelvoroSessionPtr CreateTelvoroSession(
      const Dictionary& sessionInfo, const Dictionary& userInfo,
      const std::vector<std::string>& frameworksToCheck) override;
  bool SendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo, uint16_t category,
                      uint16_t type, const Dictionary& payload, Error* error) override;

 private:
  friend class FakeTelvoroSession;
  OptionalError SendError() const;
  OptionalError FlushError() const;

  mutable std::mutex mutex_;
  Discovery discovery_ = Discovery::kAnswerAtOnce;
  std::vector<std::string> backends_{"sqlite:/fake/tavrin.db"};
  OptionalError sendError_;
  OptionalError flushError_;
  uint64_t nextToken_ = kFirstToken;
  std::vector<TelvoroTokenPtr> tokens_;
  std::vector<TelvoroTokenPtr> tokenParents_;
  std::vector<std::shared_ptr<FakeTelvoroSession>> sessions_;
  std::vector<SingleMessage> singleMessages_;
  size_t refusedSingles_ = 0;
};

}  // namespace tavrin::testing
