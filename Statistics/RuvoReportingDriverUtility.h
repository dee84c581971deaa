#pragma once

#include <array>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "base/Dictionary.h"
#include "platform/DriverStatsService.h"
#include "platform/LogSystem.h"

namespace tavrin {

// One family of driver statistics channels, named by a channel group and subgroup (either may be
// absent). Properties are atomic.
class RuvoReportingDriver {
 public:
  static std::shared_ptr<RuvoReportingDriver> driverWithGroupName(
      std::optional<std::string> groupName, std::optional<std::string> subGroupName);

  std::optional<std::string> groupName() const;
  void setGroupName(std::optional<std::string> groupName);
  std::optional<std::string> subGroupName() const;
  void setSubGroupName(std::optional<std::string> subGroupName);

  // "<group>-<subgroup>", an absent name written "(null)": "Speaker-(null)", "(null)-MCA". It is
  // the driver's key in a snapshot.
  std::string description() const;

 private:
  mutable std::mutex mutex_;
  std::optional<std::string> groupName_;
  std::optional<std::string> subGroupName_;
};

// One live subscription to the channels of one driver. The handle is a plain value the service
// handed out; nothing ever releases it. Properties are atomic.
class RuvoReportingIOChannelSubscription {
 public:
  // Subscription none (0), no subscribed channels, `driver` as given.
  explicit RuvoReportingIOChannelSubscription(std::shared_ptr<RuvoReportingDriver> driver);

  DriverSubscription subscription() const;
  void setSubscription(DriverSubscription subscription);
  // A copy of the channel description the service returned with the subscription.
  std::optional<DriverChannels> subscribedChannels() const;
  void setSubscribedChannels(std::optional<DriverChannels> subscribedChannels);
  std::shared_ptr<RuvoReportingDriver> driver() const;
  void setDriver(std::shared_ptr<RuvoReportingDriver> driver);

 private:
  mutable std::mutex mutex_;
  DriverSubscription subscription_ = 0;
  std::optional<DriverChannels> subscribedChannels_;
  std::shared_ptr<RuvoReportingDriver> driver_;
};

// Subscribes once, at creation, to the channels of the four audio-driver statistics groups and
// produces snapshots and positive per-channel differences on request. One exists per process
// (the listener delegate creates it with the process's DriverStatsService); it keeps no
// per-session state.
//
// Snapshot: a dictionary, description of a driver -> a copy of the sample set the service gave
// for it ("Haptics-Stats" -> {...}). A driver that could not be sampled has no key. Opaque to
// everyone else: stored in a session at start and handed back at stop.
//
// Delta: a dictionary, channel key -> signed 64-bit difference since the snapshot, holding only
// differences greater than zero; none instead of an empty dictionary. The channel key is the
// group followed by "_" (when there is a group), the subgroup followed by "_" (when there is one)
// and the channel's name (when it has one): "Haptics_Stats_<name>", "MCA_<name>". Keys of all
// drivers share one dictionary; a later channel with the same key replaces the earlier value.
//
// Thread-safety: the subscriptions are built in the constructor and only read afterwards, so
// the operations may run on any thread, also at the same time, as far as the service allows.
// Every log line goes to the process-wide 'rvrd' scope (the default log when it registered as
// none).
class RuvoReportingDriverUtility {
 public:
  // `service` must outlive the utility. Subscribes to every driver of DriverTable() that has at
  // least one channel; never fails, even when no driver could be subscribed.
  explicit RuvoReportingDriverUtility(DriverStatsService& service);

  // The current counters of every subscribed driver. Never none; may be empty.
  Dictionary getSnapShot();
  // Positive differences since `snapShot`; with no snapshot (null) the absolute values. None when
  // no channel has a value above zero.
  std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(const Dictionary* snapShot);
  std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(
      const std::optional<Dictionary>& snapShot) {
    return getDriverStatisticsRelativeToSnapShot(snapShot ? &*snapShot : nullptr);
  }

  // In driver table order; only drivers that had at least one channel at creation.
  const std::vector<std::shared_ptr<RuvoReportingIOChannelSubscription>>& ioChannelSubscriptions()
      const {
    return ioChannelSubscriptions_;
  }

  struct DriverName {
    const char* groupName;  // null: none
    const char* subGroupName;
  };
  // The fixed driver table, in subscription order.
  static constexpr std::array<DriverName, 4> kDriverTable{{
      {"QuorvexAE2MCA", nullptr},
      {"Speaker", nullptr},
      {nullptr, "MCA"},
      {"Haptics", "Stats"},
  }};

  // The key of channel `channelName` of `driver` in a delta ("Haptics_Stats_<name>").
  static std::string ChannelKey(const RuvoReportingDriver& driver,
                                const std::optional<std::string>& channelName);

  // The 'rvrd' log scope is registered once per process, by the first utility created. Tests that
  // install a fresh log facility call this first, so the next utility registers with theirs.
  static void ResetLogScopeForTesting();

 private:
  void init();

  DriverStatsService& service_;
  const LogHandle log_;
  std::vector<std::shared_ptr<RuvoReportingIOChannelSubscription>> ioChannelSubscriptions_;
};

}  // namespace tavrin
