#include "platform/MessageLedger.h"

#include <algorithm>

namespace tavrin {

std::string_view DropReasonName(DropReason reason) {
  static constexpr std::array<std::string_view, kDropReasonCount> kNames = {
      "reporting_disabled", "no_session",   "test_session", "no_backend",     "queue_full",
      "backend_down",       "write_failed", "too_large",    "delivery_failed"};
  return kNames[size_t(reason)];
}

Dictionary MessageCounts::ToDictionary() const {
  Dictionary dropped = MakeDictionary();
  uint64_t settled = delivered_.load();
  const uint64_t delivered = settled;
  for (size_t i = 0; i < kDropReasonCount; ++i) {
    const uint64_t count = dropped_[i].load();
    settled += count;
    if (count > 0) dropped[std::string(DropReasonName(DropReason(i)))] = count;
  }
  // A message is received before it settles, and every count is sequentially consistent:
  // reading the received count last keeps it ahead of the settled ones.
  const uint64_t received = received_.load();
  Dictionary counts = MakeDictionary();
  counts["received"] = received;
  counts["delivered"] = delivered;
  counts["dropped"] = std::move(dropped);
  counts["in_flight"] = received - std::min(received, settled);
  return counts;
}

LedgerAccount::LedgerAccount(MessageLedger& ledger, int32_t pid, uint32_t uid, std::string name)
    : ledger_(ledger), pid_(pid), uid_(uid), name_(std::move(name)) {}

void LedgerAccount::Received(uint64_t count) {
  counts_.Received(count);
  ledger_.totals().Received(count);
}

void LedgerAccount::Delivered() {
  counts_.Delivered();
  ledger_.totals().Delivered();
}

void LedgerAccount::Dropped(DropReason reason) {
  counts_.Dropped(reason);
  ledger_.totals().Dropped(reason);
}

void LedgerAccount::Close() { ledger_.CloseAccount(this); }

Dictionary LedgerAccount::ToDictionary() const {
  Dictionary entry = counts_.ToDictionary();
  entry["pid"] = pid_;
  entry["uid"] = uid_;
  entry["name"] = name_;
  entry["sessions"] = sessions();
  return entry;
}

LedgerAccountPtr MessageLedger::OpenAccount(int32_t pid, uint32_t uid, std::string name) {
  auto account = std::make_shared<LedgerAccount>(*this, pid, uid, std::move(name));
  std::lock_guard lock(mutex_);
  open_.push_back(account);
  return account;
}

void MessageLedger::CloseAccount(const LedgerAccount* account) {
  std::lock_guard lock(mutex_);
  open_.remove_if([account](const LedgerAccountPtr& open) { return open.get() == account; });
}

Dictionary MessageLedger::ToDictionary() const {
  Value clients = Value::array();
  uint64_t sessions = 0;
  {
    std::lock_guard lock(mutex_);
    for (const LedgerAccountPtr& account : open_) {
      clients.push_back(account->ToDictionary());
      sessions += account->sessions();
    }
  }
  Dictionary status = MakeDictionary();
  status["sessions"] = sessions;
  status["totals"] = totals_.ToDictionary();
  status["clients"] = std::move(clients);
  return status;
}

}  // namespace tavrin
