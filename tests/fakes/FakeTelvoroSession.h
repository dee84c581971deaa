#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "base/Dictionary.h"
#include "base/Error.h"
#include "platform/TelvoroSession.h"
#include "tests/fakes/GuardedState.h"

namespace tavrin::testing {

class FakeTelvoroService;

// One message handed to a back-end.
struct FakeTelvoroMessage {
  uint16_t category = 0;
  uint16_t type = 0;
  Dictionary payload;
  bool operator==(const FakeTelvoroMessage&) const = default;
};

// A TelvoroSession that records what it is given. Its discovery answer follows the mode its
// service had when the session was created. Thread-safe; callbacks run outside its lock.
class FakeTelvoroSession final : public TelvoroSession, private GuardedState {
 public:
  FakeTelvoroSession(FakeTelvoroService& service, size_t index, Dictionary sessionInfo,
                     Dictionary userInfo, std::vector<std::string> frameworksToCheck);

  void StartConfiguration(std::function<void(const BackendList&)> done) override;
  bool SendSessionMessage(uint16_t category, uint16_t type, const PayloadPtr& payload, Error* error,
                          const DeliveryReceiptPtr& receipt) override;
  void FlushMessages(std::function<void(const OptionalError&)> done) override;
  std::string Description() const override;

  bool DiscoveryPending() const { return static_cast<bool>(Locked(pendingDiscovery_)); }

  const Dictionary& SessionInfo() const { return sessionInfo_; }
  const Dictionary& UserInfo() const { return userInfo_; }
  const std::vector<std::string>& FrameworksToCheck() const { return frameworks_; }
  // Messages accepted, in the order they arrived (refused ones are only counted).
  std::vector<FakeTelvoroMessage> Messages() const { return Locked(messages_); }
  size_t RefusedCount() const { return Locked(refused_); }
  // How many messages had arrived when each flush was asked.
  std::vector<size_t> MessagesAtFlush() const { return Locked(messagesAtFlush_); }

 private:
  friend class FakeTelvoroService;

  FakeTelvoroService& service_;
  const size_t index_;
  const Dictionary sessionInfo_;
  const Dictionary userInfo_;
  const std::vector<std::string> frameworks_;

  std::function<void(const BackendList&)> pendingDiscovery_;  // guarded by mutex_
  std::vector<FakeTelvoroMessage> messages_;                  // guarded by mutex_
  size_t refused_ = 0;                                        // guarded by mutex_
  std::vector<size_t> messagesAtFlush_;                       // guarded by mutex_
};

// The reporting back-ends, in memory: tokens, sessions, single messages, with a scriptable
// discovery answer and injectable send and flush failures. Thread-safe.
class FakeTelvoroService final : public TelvoroService, private GuardedState {
 public:
  enum class Discovery {
    kAnswerAtOnce,  // StartConfiguration calls back before it returns, with one back-end
    kAnswerLater,   // held until the test answers (AnswerPendingDiscoveries)
    kAnswerNil,     // calls back at once with no back-ends
  };

  struct SingleMessage {
    Dictionary sessionInfo;
    Dictionary userInfo;
    uint16_t category = 0;
    uint16_t type = 0;
    Dictionary payload;
  };

  void SetDiscovery(Discovery mode) { Set(discovery_, mode); }
  // Answers every discovery still waiting; returns how many were answered.
  size_t AnswerPendingDiscoveries(const BackendList& backends);
  // Sends (session and single) fail with `error` while set.
  void FailSends(OptionalError error) { Set(sendError_, std::move(error)); }
  // Flushes call back with `error` while set.
  void FailFlushes(OptionalError error) { Set(flushError_, std::move(error)); }

  // Tokens handed out, in order, with the parent each was asked for (null for none).
  std::vector<TelvoroTokenPtr> Tokens() const { return Locked(tokens_); }
  std::vector<TelvoroTokenPtr> TokenParents() const { return Locked(tokenParents_); }
  std::vector<std::shared_ptr<FakeTelvoroSession>> Sessions() const { return Locked(sessions_); }
  std::shared_ptr<FakeTelvoroSession> LastSession() const;
  std::vector<SingleMessage> SingleMessages() const { return Locked(singleMessages_); }
  size_t RefusedSingleMessages() const { return Locked(refusedSingles_); }

  // TelvoroService
  TelvoroTokenPtr NewSecureHierarchyToken(const TelvoroTokenPtr& parent) override;
  TelvoroSessionPtr CreateTelvoroSession(
      const Dictionary& sessionInfo, const Dictionary& userInfo,
      const std::vector<std::string>& frameworksToCheck) override;
  bool SendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo, uint16_t category,
                      uint16_t type, const Dictionary& payload, Error* error,
                      const DeliveryReceiptPtr& receipt) override;

 private:
  friend class FakeTelvoroSession;

  Discovery discovery_ = Discovery::kAnswerAtOnce;
  OptionalError sendError_;
  OptionalError flushError_;
  uint64_t nextToken_ = 1000;
  std::vector<TelvoroTokenPtr> tokens_;
  std::vector<TelvoroTokenPtr> tokenParents_;
  std::vector<std::shared_ptr<FakeTelvoroSession>> sessions_;
  std::vector<SingleMessage> singleMessages_;
  size_t refusedSingles_ = 0;
};

}  // namespace tavrin::testing
