#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/DriverStatsService.h"
#include "tests/fakes/GuardedState.h"

namespace tavrin::testing {

// In-memory DriverStatsService with scriptable channels and values, and errors that can be
// injected per operation and per (group, subgroup) query. Matching follows the real service: a
// query name that is absent matches anything; a given subgroup never matches a channel without
// one.
//
// Layouts (its own, like any implementation's):
//   channels   {"query": {"group": .., "subgroup": ..}, "channels": [{"id": N, ...}, ...]}
//   samples    {"samples": [{"id": N, "name": "x" | null, "value": V}, ...]}
// Deltas match samples by "id"; an id missing from the earlier set counts from 0.
class FakeDriverStatsService final : public DriverStatsService, private GuardedState {
 public:
  using Name = std::optional<std::string>;

  // Adds a channel and returns its id. `name` may be absent (a channel without a name).
  int AddChannel(Name group, Name subgroup, Name name, int64_t value);
  void SetValue(int id, int64_t value) {
    WithLock([&] { channels_.at(size_t(id)).value = value; });
  }

  // An injected failure of one operation. `code` goes into the Error; `withResult` also returns
  // the result the operation would have given; `times` failures (-1: every call).
  struct Failure {
    int64_t code = 0;
    bool withResult = false;
    int times = -1;
  };
  // CopyChannelsInGroup for exactly this (group, subgroup) query.
  void FailCopyChannels(Name group, Name subgroup, Failure failure) {
    WithLock([&] { copyFailures_[{group, subgroup}] = failure; });
  }
  // CreateSamples of the subscription made for this (group, subgroup) query.
  void FailCreateSamples(Name group, Name subgroup, Failure failure) {
    WithLock([&] { sampleFailures_[{group, subgroup}] = failure; });
  }
  // Every CreateSamplesDelta call.
  void FailCreateSamplesDelta(Failure failure) {
    WithLock([&] { deltaFailures_[{}] = failure; });
  }
  // CopyChannelsInGroup for this query answers none without error (a service that knows no
  // such group).
  void AnswerNoChannels(Name group, Name subgroup) {
    WithLock([&] { noChannels_.emplace_back(group, subgroup); });
  }

  // What CreateSamplesDelta was given, per call.
  struct DeltaCall {
    std::optional<DriverSampleSet> earlier;  // none when null was passed
    DriverSampleSet current;
  };
  std::vector<DeltaCall> DeltaCalls() const { return Locked(deltaCalls_); }
  int CreateSubscriptionCalls() const { return Locked(createSubscriptionCalls_); }
  // The queries CopyChannelsInGroup was asked, in order.
  std::vector<std::pair<Name, Name>> Queries() const { return Locked(queries_); }

  std::optional<DriverChannels> CopyChannelsInGroup(const std::optional<std::string>& group,
                                                    const std::optional<std::string>& subgroup,
                                                    uint64_t options,
                                                    OptionalError* error) override;
  int32_t ChannelCount(const DriverChannels& channels) override;
  DriverSubscription CreateSubscription(const DriverChannels& channels, DriverChannels* subscribed,
                                        uint64_t options) override;
  std::optional<DriverSampleSet> CreateSamples(DriverSubscription subscription,
                                               const DriverChannels& subscribed,
                                               OptionalError* error) override;
  std::optional<DriverSampleSet> CreateSamplesDelta(const DriverSampleSet* earlier,
                                                    const DriverSampleSet& current,
                                                    OptionalError* error) override;
  void IterateSamples(const DriverSampleSet& samples,
                      const std::function<int(const DriverSample&)>& visit) override;
  std::optional<std::string> SampleChannelName(const DriverSample& sample) override;
  int64_t SampleIntegerValue(const DriverSample& sample) override;

  static constexpr const char* kErrorDomain = "com.quorvex.tavrin.fake.driverstats";

 private:
  struct Channel {
    Name group, subgroup, name;
    int64_t value = 0;
  };
  using Query = std::pair<Name, Name>;
  // True (and *error filled) when the scripted failure for `query` fires now; consumes one use.
  static bool Fire(std::map<Query, Failure>& failures, const Query& query, OptionalError* error);

  std::vector<Channel> channels_;  // index = id
  std::map<Query, Failure> copyFailures_;
  std::map<Query, Failure> sampleFailures_;
  std::map<Query, Failure> deltaFailures_;  // under the empty query
  std::vector<Query> noChannels_;
  std::map<DriverSubscription, Query> subscriptions_;
  DriverSubscription nextSubscription_ = 100;
  std::vector<DeltaCall> deltaCalls_;
  std::vector<Query> queries_;
  int createSubscriptionCalls_ = 0;
};

}  // namespace tavrin::testing
