#include "tests/fakes/FakeDriverStatsService.h"

#include <algorithm>
#include <unordered_map>

namespace tavrin::testing {
namespace {

bool Matches(const std::optional<std::string>& wanted, const std::optional<std::string>& actual) {
  return !wanted || wanted == actual;
}

Value NameValue(const std::optional<std::string>& name) {
  return name ? Value(*name) : Value(nullptr);
}

std::optional<std::string> NameOf(const Value& value) {
  return value.is_string() ? std::optional<std::string>(value.get<std::string>()) : std::nullopt;
}

}  // namespace

int FakeDriverStatsService::AddChannel(Name group, Name subgroup, Name name, int64_t value) {
  std::lock_guard lock(mutex_);
  channels_.push_back(Channel{std::move(group), std::move(subgroup), std::move(name), value});
  return int(channels_.size() - 1);
}

bool FakeDriverStatsService::Fire(std::map<Query, Failure>& failures, const Query& query,
                                  OptionalError* error) {
  const auto it = failures.find(query);
  if (it == failures.end() || it->second.times == 0) return false;
  if (it->second.times > 0) --it->second.times;
  if (error != nullptr) {
    *error = Error{kErrorDomain, it->second.code, "injected failure"};
  }
  return true;
}

std::optional<DriverChannels> FakeDriverStatsService::CopyChannelsInGroup(
    const std::optional<std::string>& group, const std::optional<std::string>& subgroup,
    uint64_t options, OptionalError* error) {
  std::lock_guard lock(mutex_);
  const Query query{group, subgroup};
  queries_.push_back(query);
  const bool failed = Fire(copyFailures_, query, error);
  if (failed && !copyFailures_[query].withResult) return std::nullopt;
  if (std::find(noChannels_.begin(), noChannels_.end(), query) != noChannels_.end()) {
    return std::nullopt;
  }
  Value list = Value::array();
  for (size_t id = 0; id < channels_.size(); ++id) {
    const Channel& channel = channels_[id];
    if (!Matches(group, channel.group) || !Matches(subgroup, channel.subgroup)) continue;
    list.push_back(Value{{"id", id}, {"name", NameValue(channel.name)}});
  }
  return DriverChannels{{"query", {{"group", NameValue(group)}, {"subgroup", NameValue(subgroup)}}},
                        {"channels", std::move(list)}};
}

int32_t FakeDriverStatsService::ChannelCount(const DriverChannels& channels) {
  const auto it = channels.find("channels");
  return it == channels.end() ? 0 : int32_t(it->size());
}

DriverSubscription FakeDriverStatsService::CreateSubscription(const DriverChannels& channels,
                                                              DriverChannels* subscribed,
                                                              uint64_t options) {
  std::lock_guard lock(mutex_);
  ++createSubscriptionCalls_;
  const DriverSubscription handle = nextSubscription_++;
  const Value& query = channels.at("query");
  subscriptions_[handle] = {NameOf(query.at("group")), NameOf(query.at("subgroup"))};
  if (subscribed != nullptr) *subscribed = channels;
  return handle;
}

std::optional<DriverSampleSet> FakeDriverStatsService::CreateSamples(
    DriverSubscription subscription, const DriverChannels& subscribed, OptionalError* error) {
  std::lock_guard lock(mutex_);
  const auto known = subscriptions_.find(subscription);
  if (known == subscriptions_.end()) {
    if (error != nullptr) *error = Error{kErrorDomain, 22, "unknown subscription"};
    return std::nullopt;
  }
  const bool failed = Fire(sampleFailures_, known->second, error);
  if (failed && !sampleFailures_[known->second].withResult) return std::nullopt;
  Value samples = Value::array();
  for (const auto& entry : subscribed.at("channels")) {
    const auto id = entry.at("id").get<size_t>();
    if (id >= channels_.size()) continue;
    samples.push_back(
        Value{{"id", id}, {"name", NameValue(channels_[id].name)}, {"value", channels_[id].value}});
  }
  return DriverSampleSet{{"samples", std::move(samples)}};
}

std::optional<DriverSampleSet> FakeDriverStatsService::CreateSamplesDelta(
    const DriverSampleSet* earlier, const DriverSampleSet& current, OptionalError* error) {
  std::lock_guard lock(mutex_);
  deltaCalls_.push_back(
      DeltaCall{earlier ? std::optional<DriverSampleSet>(*earlier) : std::nullopt, current});
  if (Fire(deltaFailures_, {}, error) && !deltaFailures_[{}].withResult) return std::nullopt;
  std::unordered_map<size_t, int64_t> before;
  if (earlier != nullptr) {
    for (const auto& sample : earlier->at("samples")) {
      before[sample.at("id").get<size_t>()] = sample.at("value").get<int64_t>();
    }
  }
  Value deltas = Value::array();
  for (const auto& sample : current.at("samples")) {
    Value delta = sample;
    const auto it = before.find(sample.at("id").get<size_t>());
    delta["value"] = sample.at("value").get<int64_t>() - (it == before.end() ? 0 : it->second);
    deltas.push_back(std::move(delta));
  }
  return DriverSampleSet{{"samples", std::move(deltas)}};
}

void FakeDriverStatsService::IterateSamples(const DriverSampleSet& samples,
                                            const std::function<int(const DriverSample&)>& visit) {
  for (const auto& entry : samples.at("samples")) {
    DriverSample sample;
    const Value& name = entry.at("name");
    sample.channelName = name.is_string() ? &name.get_ref<const std::string&>() : nullptr;
    sample.value = entry.at("value").get<int64_t>();
    if (visit(sample) != 0) return;
  }
}

std::optional<std::string> FakeDriverStatsService::SampleChannelName(const DriverSample& sample) {
  if (sample.channelName == nullptr) return std::nullopt;
  return *sample.channelName;
}

int64_t FakeDriverStatsService::SampleIntegerValue(const DriverSample& sample) {
  return sample.value;
}

}  // namespace tavrin::testing
