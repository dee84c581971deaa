#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "base/Dictionary.h"
#include "base/Error.h"

namespace tavrin {

// Channel descriptions and sample sets are dictionaries whose layout belongs to the
// implementation; callers copy and store them but look inside only through the operations below.
using DriverChannels = Dictionary;
using DriverSampleSet = Dictionary;
using DriverSubscription = uint64_t;

// One sample of a sample set, valid during an IterateSamples callback.
struct DriverSample {
  const std::string* channelName = nullptr;  // null when the channel has no name
  int64_t value = 0;
};

// The audio drivers' statistics channels. Failures come back as an Error with a numeric code.
class DriverStatsService {
 public:
  virtual ~DriverStatsService() = default;
  // The channels whose group and subgroup equal the names given; an absent name matches any.
  virtual std::optional<DriverChannels> CopyChannelsInGroup(
      const std::optional<std::string>& group, const std::optional<std::string>& subgroup,
      uint64_t options, OptionalError* error) = 0;
  virtual int32_t ChannelCount(const DriverChannels& channels) = 0;
  // Subscribes to `channels`; fills *subscribed with the channels actually subscribed.
  virtual DriverSubscription CreateSubscription(const DriverChannels& channels,
                                                DriverChannels* subscribed, uint64_t options) = 0;
  // The current value of every subscribed channel, read now.
  virtual std::optional<DriverSampleSet> CreateSamples(DriverSubscription subscription,
                                                       const DriverChannels& subscribed,
                                                       OptionalError* error) = 0;
  // Per-channel differences `current - earlier`; a missing earlier set counts as all zero.
  virtual std::optional<DriverSampleSet> CreateSamplesDelta(const DriverSampleSet* earlier,
                                                            const DriverSampleSet& current,
                                                            OptionalError* error) = 0;
  // Calls `visit` once per sample until it returns non-zero.
  virtual void IterateSamples(const DriverSampleSet& samples,
                              const std::function<int(const DriverSample&)>& visit) = 0;
  virtual std::optional<std::string> SampleChannelName(const DriverSample& sample) = 0;
  virtual int64_t SampleIntegerValue(const DriverSample& sample) = 0;
};

}  // namespace tavrin
