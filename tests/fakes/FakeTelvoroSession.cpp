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
  const FakeTelvoroService::Discovery mode = service_.DiscoveryMode();
  {
    std::lock_guard lock(mutex_);
    ++startConfigurationCalls_;
    if (mode == FakeTelvoroService::Discovery::kAnswerLater ||
        mode == FakeTelvoroService::Discovery::kNeverAnswer) {
      pendingDiscovery_ = std::move(done);
      return;
    }
  }
  if (!done) return;
  if (mode == FakeTelvoroService::Discovery::kAnswerNil) {
    done(std::nullopt);
  } else {
    done(service_.Backends());
  }
}

bool FakeTelvoroSession::AnswerDiscovery(const BackendList& backends) {
  std::function<void(const BackendList&)> done;
  {
    std::lock_guard lock(mutex_);
    done = std::exchange(pendingDiscovery_, nullptr);
  }
  if (!done) return false;
  done(backends);
  return true;
}

bool FakeTelvoroSession::DiscoveryPending() const {
  std::lock_guard lock(mutex_);
  return static_cast<bool>(pendingDiscovery_);
}

size_t FakeTelvoroSession::StartConfigurationCalls() const {
  std::lock_guard lock(mutex_);
  return startConfigurationCalls_;
}

bool FakeTelvoroSession::SendSessionMessage(uint16_t category, uint16_t type,
                                            const Dictionary& payload, Error* error) {
  OptionalError failure = service_.SendError();
  std::lock_guard lock(mutex_);
  if (failure) {
    ++refused_;
    if (error != nullptr) *error = *failure;
    return false;
  }
  messages_.push_back(FakeTelvoroMessage{category, type, payload});
  return true;
}

void FakeTelvoroSession::FlushMessages(std::function<void(const OptionalError&)> done) {
  OptionalError failure = service_.FlushError();
  {
    std::lock_guard lock(mutex_);
    messagesAtFlush_.push_back(messages_.size());
  }
  if (done) done(failure);
}

std::string FakeTelvoroSession::Description() const {
  return fmt::format("<FakeTelvoroSession {}>", index_);
}

std::vector<FakeTelvoroMessage> FakeTelvoroSession::Messages() const {
  std::lock_guard lock(mutex_);
  return messages_;
}

size_t FakeTelvoroSession::RefusedCount() const {
  std::lock_guard lock(mutex_);
  return refused_;
}

size_t FakeTelvoroSession::FlushCount() const {
  std::lock_guard lock(mutex_);
  return messagesAtFlush_.size();
}

std::vector<size_t> FakeTelvoroSession::MessagesAtFlush() const {
  std::lock_guard lock(mutex_);
  return messagesAtFlush_;
}

void FakeTelvoroService::SetDiscovery(Discovery mode) {
  std::lock_guard lock(mutex_);
  discovery_ = mode;
}

FakeTelvoroService::Discovery FakeTelvoroService::DiscoveryMode() const {
  std::lock_guard lock(mutex_);
  return discovery_;
}

void FakeTelvoroService::SetBackends(std::vector<std::string> backends) {
  std::lock_guard lock(mutex_);
  backends_ = std::move(backends);
}

std::vector<std::string> FakeTelvoroService::Backends() const {
  std::lock_guard lock(mutex_);
  return backends_;
}

size_t FakeTelvoroService::AnswerPendingDiscoveries(const BackendList& backends) {
  size_t answered = 0;
  for (const auto& session : Sessions()) answered += session->AnswerDiscovery(backends) ? 1 : 0;
  return answered;
}

void FakeTelvoroService::FailSends(OptionalError error) {
  std::lock_guard lock(mutex_);
  sendError_ = std::move(error);
}

void FakeTelvoroService::FailFlushes(OptionalError error) {
  std::lock_guard lock(mutex_);
  flushError_ = std::move(error);
}

OptionalError FakeTelvoroService::SendError() const {
  std::lock_guard lock(mutex_);
  return sendError_;
}

OptionalError FakeTelvoroService::FlushError() const {
  std::lock_guard lock(mutex_);
  return flushError_;
}

std::vector<TelvoroTokenPtr> FakeTelvoroService::Tokens() const {
  std::lock_guard lock(mutex_);
  return tokens_;
}

std::vector<TelvoroTokenPtr> FakeTelvoroService::TokenParents() const {
  std::lock_guard lock(mutex_);
  return tokenParents_;
}

std::vector<std::shared_ptr<FakeTelvoroSession>> FakeTelvoroService::Sessions() const {
  std::lock_guard lock(mutex_);
  return sessions_;
}

std::shared_ptr<FakeTelvoroSession> FakeTelvoroService::LastSession() const {
  std::lock_guard lock(mutex_);
  return sessions_.empty() ? nullptr : sessions_.back();
}

std::vector<FakeTelvoroService::SingleMessage> FakeTelvoroService::SingleMessages() const {
  std::lock_guard lock(mutex_);
  return singleMessages_;
}

size_t FakeTelvoroService::RefusedSingleMessages() const {
  std::lock_guard lock(mutex_);
  return refusedSingles_;
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
                                        Error* error) {
  std::lock_guard lock(mutex_);
  if (sendError_) {
    ++refusedSingles_;
    if (error != nullptr) *error = *sendError_;
    return false;
  }
  singleMessages_.push_back(SingleMessage{sessionInfo, userInfo, category, type, payload});
  return true;
}

}  // namespace tavrin::testing
