#include "Statistics/RuvoReportingDriverUtility.h"

#include <utility>

namespace tavrin {
namespace {

std::string NameText(const std::optional<std::string>& name) { return name ? *name : "(null)"; }

std::optional<std::string> OptionalName(const char* name) {
  return name == nullptr ? std::nullopt : std::optional<std::string>(name);
}

// The module's log scope, registered once per process and kept for its life.
struct DriverLogScope {
  std::mutex mutex;
  bool registered = false;
  LogHandle handle;
};

DriverLogScope& ProcessDriverLogScope() {
  static DriverLogScope scope;
  return scope;
}

LogHandle DriverLog() {
  DriverLogScope& scope = ProcessDriverLogScope();
  std::lock_guard lock(scope.mutex);
  if (!scope.registered) {
    scope.handle = RegisterLogScope(true, FourCharCode("rvrd"), "rvrd", "com.quorvex.tavrin",
                                    "reporting_driver_verbose", 31);
    scope.registered = true;
  }
  return scope.handle;
}

}  // namespace

// --- RuvoReportingDriver ---

std::shared_ptr<RuvoReportingDriver> RuvoReportingDriver::driverWithGroupName(
    std::optional<std::string> groupName, std::optional<std::string> subGroupName) {
  auto driver = std::make_shared<RuvoReportingDriver>();
  driver->setGroupName(std::move(groupName));
  driver->setSubGroupName(std::move(subGroupName));
  return driver;
}

std::optional<std::string> RuvoReportingDriver::groupName() const {
  std::lock_guard lock(mutex_);
  return groupName_;
}

void RuvoReportingDriver::setGroupName(std::optional<std::string> groupName) {
  std::lock_guard lock(mutex_);
  groupName_ = std::move(groupName);
}

std::optional<std::string> RuvoReportingDriver::subGroupName() const {
  std::lock_guard lock(mutex_);
  return subGroupName_;
}

void RuvoReportingDriver::setSubGroupName(std::optional<std::string> subGroupName) {
  std::lock_guard lock(mutex_);
  subGroupName_ = std::move(subGroupName);
}

std::string RuvoReportingDriver::description() const {
  return NameText(groupName()) + "-" + NameText(subGroupName());
}

// --- RuvoReportingIOChannelSubscription ---

RuvoReportingIOChannelSubscription::RuvoReportingIOChannelSubscription(
    std::shared_ptr<RuvoReportingDriver> driver)
    : driver_(std::move(driver)) {}

DriverSubscription RuvoReportingIOChannelSubscription::subscription() const {
  std::lock_guard lock(mutex_);
  return subscription_;
}

void RuvoReportingIOChannelSubscription::setSubscription(DriverSubscription subscription) {
  std::lock_guard lock(mutex_);
  subscription_ = subscription;
}

std::optional<DriverChannels> RuvoReportingIOChannelSubscription::subscribedChannels() const {
  std::lock_guard lock(mutex_);
  return subscribedChannels_;
}

void RuvoReportingIOChannelSubscription::setSubscribedChannels(
    std::optional<DriverChannels> subscribedChannels) {
  std::lock_guard lock(mutex_);
  subscribedChannels_ = std::move(subscribedChannels);
}

std::shared_ptr<RuvoReportingDriver> RuvoReportingIOChannelSubscription::driver() const {
  std::lock_guard lock(mutex_);
  return driver_;
}

void RuvoReportingIOChannelSubscription::setDriver(std::shared_ptr<RuvoReportingDriver> driver) {
  std::lock_guard lock(mutex_);
  driver_ = std::move(driver);
}

// --- RuvoReportingDriverUtility ---

RuvoReportingDriverUtility::RuvoReportingDriverUtility(DriverStatsService& service)
    : service_(service), log_(DriverLog()) {
  init();
}

void RuvoReportingDriverUtility::ResetLogScopeForTesting() {
  DriverLogScope& scope = ProcessDriverLogScope();
  std::lock_guard lock(scope.mutex);
  scope.registered = false;
  scope.handle = nullptr;
}

void RuvoReportingDriverUtility::init() {
  TLOG_INFO(log_, "creating metrioning driver utility");
  ioChannelSubscriptions_.clear();
  for (const auto& entry : kDriverTable) {
    auto driver = RuvoReportingDriver::driverWithGroupName(OptionalName(entry.groupName),
                                                           OptionalName(entry.subGroupName));
    const auto group = driver->groupName();
    const auto subgroup = driver->subGroupName();
    OptionalError error;
    auto channels = service_.CopyChannelsInGroup(group, subgroup, 0, &error);
    if (error) {
      // Channels that came back with the error are still used.
      TLOG_ERROR(log_, "error {} getting channels for driver {}-{}", error->code, NameText(group),
                 NameText(subgroup));
    }
    if (!channels) continue;
    if (service_.ChannelCount(*channels) < 1) {
      TLOG_INFO(log_, "couldn't find any channels for driver group {}-{}", NameText(group),
                NameText(subgroup));
    } else {
      auto subscription = std::make_shared<RuvoReportingIOChannelSubscription>(driver);
      DriverChannels subscribed;
      // The handle is kept unchecked: a bad one shows up as a sampling error later.
      subscription->setSubscription(service_.CreateSubscription(*channels, &subscribed, 0));
      subscription->setSubscribedChannels(std::move(subscribed));
      ioChannelSubscriptions_.push_back(std::move(subscription));
    }
    // Written for every driver that returned a channel description, with channels or not.
    TLOG_DEFAULT(log_, "subscribed to group group {}-{}", NameText(group), NameText(subgroup));
  }
}

Dictionary RuvoReportingDriverUtility::getSnapShot() {
  Dictionary snapShot = MakeDictionary();
  for (const auto& subscription : ioChannelSubscriptions_) {
    const auto driver = subscription->driver();
    const std::string description = driver->description();
    TLOG_INFO(log_, "sampling driver {}", description);
    OptionalError error;
    const auto subscribed = subscription->subscribedChannels().value_or(MakeDictionary());
    auto samples = service_.CreateSamples(subscription->subscription(), subscribed, &error);
    if (error) {
      // A sample set that came with the error is not trusted.
      TLOG_ERROR(log_, "MetrionCreateSamples error {}", error->code);
      continue;
    }
    if (samples) snapShot[description] = std::move(*samples);
  }
  return snapShot;
}

std::optional<Dictionary> RuvoReportingDriverUtility::getDriverStatisticsRelativeToSnapShot(
    const Dictionary* snapShot) {
  Dictionary result = MakeDictionary();
  for (const auto& subscription : ioChannelSubscriptions_) {
    const auto driver = subscription->driver();
    OptionalError error;
    TLOG_INFO(log_, "getting latest samples");
    const auto subscribed = subscription->subscribedChannels().value_or(MakeDictionary());
    const auto current = service_.CreateSamples(subscription->subscription(), subscribed, &error);
    TLOG_INFO(log_, "done getting latest samples");
    if (error) {
      TLOG_ERROR(log_, "MetrionCreateSamples error {}", error->code);
      continue;
    }
    if (!current) continue;

    std::optional<DriverSampleSet> difference;
    if (snapShot == nullptr) {
      difference = *current;  // no snapshot: report the absolute counter values
    } else {
      const DriverSampleSet* earlier = nullptr;
      if (snapShot->is_object()) {
        const auto found = snapShot->find(driver->description());
        if (found != snapShot->end()) earlier = &*found;
      }
      difference = service_.CreateSamplesDelta(earlier, *current, &error);
      if (error) {
        // Deliberate: absolute values are better than nothing for this driver.
        TLOG_ERROR(log_, "MetrionCreateSamplesDelta error {}", error->code);
        difference = *current;
      }
    }
    if (!difference) continue;
    service_.IterateSamples(*difference, [&](const DriverSample& sample) {
      const int64_t value = service_.SampleIntegerValue(sample);
      if (value < 1) return 0;
      result[ChannelKey(*driver, service_.SampleChannelName(sample))] = value;
      return 0;
    });
  }
  if (result.empty()) return std::nullopt;
  return result;
}

std::string RuvoReportingDriverUtility::ChannelKey(const RuvoReportingDriver& driver,
                                                   const std::optional<std::string>& channelName) {
  std::string key;
  if (const auto group = driver.groupName()) key += *group + "_";
  if (const auto subgroup = driver.subGroupName()) key += *subgroup + "_";
  if (channelName) key += *channelName;
  return key;
}

}  // namespace tavrin
