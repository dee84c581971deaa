#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/Dictionary.h"
#include "base/Error.h"
#include "platform/MessageLedger.h"

namespace tavrin {

// Keys of the session-info and user-info dictionaries handed to the reporting back-ends.
inline constexpr const char* kTelvoroSessionInfoClientType = "ClientType";
inline constexpr const char* kTelvoroSessionInfoClientVersion = "ClientVersion";
inline constexpr const char* kTelvoroSessionInfoSessionID = "SessionID";
inline constexpr const char* kTelvoroSessionInfoBatchEvent = "BatchEvent";
inline constexpr const char* kTelvoroSessionInfoHierarchyToken = "HierarchyToken";
inline constexpr const char* kTelvoroSessionInfoContainsRealtimeEvents = "ContainsRealtimeEvents";
// True for the session of a summary sent on a later start, from what a session that was open
// when the service ended had spooled.
inline constexpr const char* kTelvoroSessionInfoRecovered = "Recovered";
inline constexpr const char* kTelvoroUserInfoClientName = "ClientName";
inline constexpr const char* kTelvoroUserInfoServiceName = "ServiceName";

// An opaque token that places a session in the back-ends' hierarchy. In a session-info
// dictionary it is stored as its number.
struct TelvoroSecureHierarchyToken {
  uint64_t value = 0;
};
using TelvoroTokenPtr = std::shared_ptr<const TelvoroSecureHierarchyToken>;

// The back-ends found by discovery, e.g. {"sqlite:/var/lib/tavrin/tavrin.db"}; nothing when no
// back-end is configured or none is up.
using BackendList = std::optional<std::vector<std::string>>;

// One real-time reporting session against the back-ends. Calls on one session come from one
// serial queue; callbacks may arrive on any thread.
class TelvoroSession {
 public:
  virtual ~TelvoroSession() = default;
  // Discovery: calls `done` once, later, with the back-ends that are up.
  virtual void StartConfiguration(std::function<void(const BackendList&)> done) = 0;
  // Hands one message over; never blocks on I/O. False (and *error when given) when the message
  // could not be accepted. `receipt`, when given, is told exactly once what became of it (at
  // once when it is refused, later when it is committed or lost).
  // The payload is shared, never copied, by what keeps it.
  virtual bool SendSessionMessage(uint16_t category, uint16_t type, const PayloadPtr& payload,
                                  Error* error, const DeliveryReceiptPtr& receipt = nullptr) = 0;
  // Calls `done` once everything handed over before is committed or acknowledged, with an error
  // when that failed.
  virtual void FlushMessages(std::function<void(const OptionalError&)> done) = 0;
  // What "%@" prints for the session.
  virtual std::string Description() const = 0;
};
using TelvoroSessionPtr = std::shared_ptr<TelvoroSession>;

// The reporting back-ends' entry points.
class TelvoroService {
 public:
  virtual ~TelvoroService() = default;
  virtual TelvoroTokenPtr NewSecureHierarchyToken(const TelvoroTokenPtr& parent) = 0;
  virtual TelvoroSessionPtr CreateTelvoroSession(
      const Dictionary& sessionInfo, const Dictionary& userInfo,
      const std::vector<std::string>& frameworksToCheck) = 0;
  // Sends one message without a session. Never blocks on I/O. `receipt` as for
  // SendSessionMessage.
  virtual bool SendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo,
                              uint16_t category, uint16_t type, const Dictionary& payload,
                              Error* error, const DeliveryReceiptPtr& receipt = nullptr) = 0;
};

}  // namespace tavrin
