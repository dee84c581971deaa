#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <list>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>

#include "base/Dictionary.h"

namespace tavrin {

// Why a client's message did not reach the back-ends. A fixed set, so that counts by reason stay
// few whatever the back-ends' own error texts say.
enum class DropReason : uint8_t {
  kReportingDisabled,  // the defaults disable reporting
  kNoSession,          // the message named a reporter ID with no session
  kTestSession,        // sessions of the "test" service type never send
  kNoBackend,          // no back-end is configured, or none was found for the session
  kQueueFull,          // a back-end's queue was full
  kBackendDown,        // a back-end was not up (or was shut down)
  kWriteFailed,        // the store could not write it
  kTooLarge,           // over what a back-end accepts in one record
  kDeliveryFailed,     // the brokers did not acknowledge it
};
inline constexpr size_t kDropReasonCount = 9;

// The name a reason has in the status and the metrics: "reporting_disabled", ...
std::string_view DropReasonName(DropReason reason);

// What became of one client message handed on for delivery: told exactly once, as delivered
// (committed by the store or acknowledged by Kafka) or as dropped with its reason. Thread-safe.
class DeliveryReceipt {
 public:
  virtual ~DeliveryReceipt() = default;
  virtual void Delivered() = 0;
  virtual void Dropped(DropReason reason) = 0;
};
using DeliveryReceiptPtr = std::shared_ptr<DeliveryReceipt>;

// Tells `receipt`, when there is one.
inline void Settle(const DeliveryReceiptPtr& receipt, bool delivered,
                   DropReason reason = DropReason::kBackendDown) {
  if (!receipt) return;
  if (delivered) {
    receipt->Delivered();
  } else {
    receipt->Dropped(reason);
  }
}

// Counts of messages, for one client or all of them. Every message is counted once as received
// and, later, once as delivered or dropped; what is neither is in flight.
class MessageCounts {
 public:
  void Received(uint64_t count = 1) { received_.fetch_add(count); }
  void Delivered() { delivered_.fetch_add(1); }
  void Dropped(DropReason reason) { dropped_[size_t(reason)].fetch_add(1); }
  // {"received", "delivered", "dropped": {reason: count}, "in_flight"}; settled counts are read
  // before the received one, so in flight is never negative.
  Dictionary ToDictionary() const;

 private:
  std::atomic<uint64_t> received_{0};
  std::atomic<uint64_t> delivered_{0};
  std::array<std::atomic<uint64_t>, kDropReasonCount> dropped_{};
};

class MessageLedger;

// One client's account: its counts feed the ledger's totals as well. It may outlive the client's
// connection while its messages are in flight, and keeps counting them.
class LedgerAccount final : public DeliveryReceipt {
 public:
  LedgerAccount(MessageLedger& ledger, int32_t pid, uint32_t uid, std::string name);
  void Received(uint64_t count = 1);
  void Delivered() override;
  void Dropped(DropReason reason) override;
  // Takes the account off the ledger's list of clients (the client went away).
  void Close();
  void SetSessions(uint64_t sessions) { sessions_.store(sessions); }
  uint64_t sessions() const { return sessions_.load(); }
  // The client's entry of the status: its counts, "pid", "uid", "name" and "sessions".
  Dictionary ToDictionary() const;

 private:
  MessageLedger& ledger_;
  const int32_t pid_;
  const uint32_t uid_;
  const std::string name_;
  std::atomic<uint64_t> sessions_{0};
  MessageCounts counts_;
};
using LedgerAccountPtr = std::shared_ptr<LedgerAccount>;

// The account of every client message: received = delivered + dropped + in flight, per client
// and in total, at every moment. Totals keep the counts of clients that went away. Thread-safe;
// must outlive its accounts.
class MessageLedger {
 public:
  // A connected client's account, listed under "clients" until it is closed.
  LedgerAccountPtr OpenAccount(int32_t pid, uint32_t uid, std::string name);
  void CloseAccount(const LedgerAccount* account);

  MessageCounts& totals() { return totals_; }
  // {"totals": {...}, "clients": [...], "sessions": open sessions of connected clients}.
  Dictionary ToDictionary() const;

 private:
  MessageCounts totals_;
  mutable std::mutex mutex_;
  std::list<LedgerAccountPtr> open_;  // guarded by mutex_
};

}  // namespace tavrin
