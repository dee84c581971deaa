#include "tests/fakes/FakeTelvoroSession.h"

#include <utility>

#include <fmt/format.h>

namespace tavrin::testing {

FakeTelvoroSession::FakeTelvoroSession(FakeTelvoroService& service, size_t index,
                                       Dictionary sessionInfo, Dictionary userInfo,
                                       std::vector<std::string> frameworksToCheck)
    : service_(service),
      index_(index),
      sessionInfo_(std::move(sessionInfo)),
      userInfo_(std::move(userInfo)),
      frameworks_(std::move(frameworksToCheck)) {}

void FakeTelvoroSession::StartConfiguration(std::function<void(const BackendList&)> done) {
  const FakeTelvoroService::Discovery mode = service_.Locked(service_.discovery_);
  if (mode == FakeTelvoroService::Discovery::kAnswerLater) {
    std::lock_guard lock(mutex_);
    pendingDiscovery_ = std::move(done);
  } else if (done) {
    done(mode == FakeTelvoroService::Discovery::kAnswerNil
             ? BackendList()
             : BackendList(std::vector<std::string>{"sqlite:/fake/tavrin.db"}));
  }
}

// A refused message is dropped as by a full queue; an accepted one counts as committed at once.
bool FakeTelvoroSession::SendSessionMessage(uint16_t category, uint16_t type,
                                            const PayloadPtr& payload, Error* error,
                                            const DeliveryReceiptPtr& receipt) {
  const OptionalError failure = service_.Locked(service_.sendError_);
  if (failure && error != nullptr) *error = *failure;
  WithLock([&] {
    if (failure)
      ++refused_;
    else
      messages_.push_back(FakeTelvoroMessage{category, type, *payload});
  });
  Settle(receipt, !failure, DropReason::kQueueFull);
  return !failure;
}

void FakeTelvoroSession::FlushMessages(std::function<void(const OptionalError&)> done) {
  OptionalError failure = service_.Locked(service_.flushError_);
  WithLock([&] { messagesAtFlush_.push_back(messages_.size()); });
  if (done) done(failure);
}

std::string FakeTelvoroSession::Description() const {
  return fmt::format("<FakeTelvoroSession {}>", index_);
}

size_t FakeTelvoroService::AnswerPendingDiscoveries(const BackendList& backends) {
  size_t answered = 0;
  for (const auto& session : Sessions()) {
    const auto done =
        session->WithLock([&] { return std::exchange(session->pendingDiscovery_, nullptr); });
    if (!done) continue;
    done(backends);
    ++answered;
  }
  return answered;
}

std::shared_ptr<FakeTelvoroSession> FakeTelvoroService::LastSession() const {
  return WithLock([&] { return sessions_.empty() ? nullptr : sessions_.back(); });
}

TelvoroTokenPtr FakeTelvoroService::NewSecureHierarchyToken(const TelvoroTokenPtr& parent) {
  std::lock_guard lock(mutex_);
  auto token = std::make_shared<const TelvoroSecureHierarchyToken>(
      TelvoroSecureHierarchyToken{nextToken_++});
  tokens_.push_back(token);
  tokenParents_.push_back(parent);
  return token;
}

TelvoroSessionPtr FakeTelvoroService::CreateTelvoroSession(
    const Dictionary& sessionInfo, const Dictionary& userInfo,
    const std::vector<std::string>& frameworksToCheck) {
  std::lock_guard lock(mutex_);
  auto session = std::make_shared<FakeTelvoroSession>(*this, sessions_.size(), sessionInfo,
                                                      userInfo, frameworksToCheck);
  sessions_.push_back(session);
  return session;
}

bool FakeTelvoroService::SendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo,
                                        uint16_t category, uint16_t type, const Dictionary& payload,
                                        Error* error, const DeliveryReceiptPtr& receipt) {
  const OptionalError failure = Locked(sendError_);
  if (failure && error != nullptr) *error = *failure;
  WithLock([&] {
    if (failure)
      ++refusedSingles_;
    else
      singleMessages_.push_back(SingleMessage{sessionInfo, userInfo, category, type, payload});
  });
  Settle(receipt, !failure, DropReason::kQueueFull);
  return !failure;
}

}  // namespace tavrin::testing
