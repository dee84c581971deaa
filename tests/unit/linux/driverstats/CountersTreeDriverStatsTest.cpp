#include "platform/linux/driverstats/CountersTreeDriverStats.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <map>
#include <thread>

#include "tests/fakes/FakeLogSystem.h"
#include "tests/support/TempCountersTree.h"

namespace tavrin {
namespace {

using testing::FakeLogSystem;
using testing::TempCountersTree;

struct ChannelRow {
  std::string group;
  std::string subgroup;  // "" for none
  std::string name;
  std::string path;
  bool operator==(const ChannelRow&) const = default;
};

std::ostream& operator<<(std::ostream& out, const ChannelRow& row) {
  return out << row.group << "|" << row.subgroup << "|" << row.name << "|" << row.path;
}

std::vector<ChannelRow> Rows(const DriverChannels& channels) {
  std::vector<ChannelRow> rows;
  for (const auto& entry : channels.at("channels")) {
    rows.push_back({entry.at("group").get<std::string>(),
                    entry.at("subgroup").is_null() ? "" : entry.at("subgroup").get<std::string>(),
                    entry.at("name").get<std::string>(), entry.at("path").get<std::string>()});
  }
  return rows;
}

// name -> value of every sample, through the service's own accessors.
std::map<std::string, int64_t> Values(DriverStatsService& service, const DriverSampleSet& set) {
  std::map<std::string, int64_t> values;
  service.IterateSamples(set, [&](const DriverSample& sample) {
    values[service.SampleChannelName(sample).value_or("<none>")] =
        service.SampleIntegerValue(sample);
    return 0;
  });
  return values;
}

class CountersTreeDriverStatsTest : public ::testing::Test {
 protected:
  // Subscribes to (group, subgroup) and returns the handle; `subscribed` receives the channels.
  DriverSubscription Subscribe(const std::optional<std::string>& group,
                               const std::optional<std::string>& subgroup,
                               DriverChannels* subscribed) {
    OptionalError error;
    auto channels = service.CopyChannelsInGroup(group, subgroup, 0, &error);
    EXPECT_FALSE(error) << error->description;
    EXPECT_TRUE(channels);
    return service.CreateSubscription(*channels, subscribed, 0);
  }
  std::map<std::string, int64_t> Sample(DriverSubscription handle,
                                        const DriverChannels& subscribed) {
    OptionalError error;
    auto samples = service.CreateSamples(handle, subscribed, &error);
    EXPECT_FALSE(error) << error->description;
    return samples ? Values(service, *samples) : std::map<std::string, int64_t>{};
  }

  FakeLogSystem log;
  TempCountersTree tree;
  CountersTreeDriverStats service{tree.root()};
};

TEST(ParseCounterTextTest, AcceptsOneSigned64BitIntegerWithWhiteSpaceAround) {
  EXPECT_EQ(ParseCounterText("42"), 42);
  EXPECT_EQ(ParseCounterText("  -7\n"), -7);
  EXPECT_EQ(ParseCounterText("0\r\n"), 0);
  EXPECT_EQ(ParseCounterText("9223372036854775807"), INT64_MAX);
  EXPECT_EQ(ParseCounterText("-9223372036854775808"), INT64_MIN);
}

TEST(ParseCounterTextTest, RejectsGarbageEmptinessAndOverflow) {
  for (const char* text :
       {"", " \n", "12abc", "abc", "1.5", "0x10", "1 2", "+5", "--1", "-", "9223372036854775808",
        "-9223372036854775809", "99999999999999999999999"}) {
    EXPECT_EQ(ParseCounterText(text), std::nullopt) << '"' << text << '"';
  }
  EXPECT_EQ(ParseCounterText(std::string_view("1\0", 2)), std::nullopt);
}

TEST_F(CountersTreeDriverStatsTest, MissingRootIsAnErrorWithErrnoCode) {
  CountersTreeDriverStats missing(tree.root() + "/nowhere");
  OptionalError error;
  EXPECT_EQ(missing.CopyChannelsInGroup("Speaker", std::nullopt, 0, &error), std::nullopt);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, ENOENT);
  EXPECT_EQ(error->domain, kDriverStatsErrorDomain);
  EXPECT_NE(error->description.find("nowhere"), std::string::npos);

  tree.write("plainfile", 1);
  CountersTreeDriverStats notDirectory(tree.path("plainfile"));
  error.reset();
  EXPECT_EQ(notDirectory.CopyChannelsInGroup(std::nullopt, std::nullopt, 0, &error), std::nullopt);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, ENOTDIR);
}

TEST_F(CountersTreeDriverStatsTest, RootCreatedAfterConstructionIsSeen) {
  CountersTreeDriverStats later(tree.root() + "/later");
  OptionalError error;
  EXPECT_FALSE(later.CopyChannelsInGroup("G", std::nullopt, 0, &error));
  tree.write("later/G/c", 5);
  error.reset();
  auto channels = later.CopyChannelsInGroup("G", std::nullopt, 0, &error);
  EXPECT_FALSE(error);
  ASSERT_TRUE(channels);
  EXPECT_EQ(later.ChannelCount(*channels), 1);
}

TEST_F(CountersTreeDriverStatsTest, MatchingByGroupAndSubgroupAbsentNamesMatchAny) {
  tree.write("QuorvexAE2MCA/underruns", 1);
  tree.write("QuorvexAE2MCA/overruns", 2);
  tree.write("Speaker/temperature", 3);
  tree.write("Speaker/MCA/resets", 4);
  tree.write("Other/MCA/resets", 5);
  tree.write("Haptics/Stats/kicks", 6);
  tree.write("Haptics/clicks", 7);
  tree.write("Haptics/Other/hums", 8);

  OptionalError error;
  // A group with no subgroup named: its own channels first, then each subgroup's, by name.
  auto haptics = service.CopyChannelsInGroup("Haptics", std::nullopt, 0, &error);
  ASSERT_TRUE(haptics);
  EXPECT_EQ(Rows(*haptics), (std::vector<ChannelRow>{
                                {"Haptics", "", "clicks", "Haptics/clicks"},
                                {"Haptics", "Other", "hums", "Haptics/Other/hums"},
                                {"Haptics", "Stats", "kicks", "Haptics/Stats/kicks"},
                            }));
  auto stats = service.CopyChannelsInGroup("Haptics", "Stats", 0, &error);
  ASSERT_TRUE(stats);
  EXPECT_EQ(Rows(*stats),
            (std::vector<ChannelRow>{{"Haptics", "Stats", "kicks", "Haptics/Stats/kicks"}}));
  // A subgroup with no group named: that subgroup in every group, never a group's own channels.
  auto mca = service.CopyChannelsInGroup(std::nullopt, "MCA", 0, &error);
  ASSERT_TRUE(mca);
  EXPECT_EQ(Rows(*mca), (std::vector<ChannelRow>{
                            {"Other", "MCA", "resets", "Other/MCA/resets"},
                            {"Speaker", "MCA", "resets", "Speaker/MCA/resets"},
                        }));
  auto quorvex = service.CopyChannelsInGroup("QuorvexAE2MCA", std::nullopt, 0, &error);
  ASSERT_TRUE(quorvex);
  EXPECT_EQ(service.ChannelCount(*quorvex), 2);
  auto all = service.CopyChannelsInGroup(std::nullopt, std::nullopt, 0, &error);
  ASSERT_TRUE(all);
  EXPECT_EQ(service.ChannelCount(*all), 8);
  EXPECT_FALSE(error);
}

TEST_F(CountersTreeDriverStatsTest, MissingGroupIsAnEmptyDescriptionNotAnError) {
  tree.write("Speaker/temperature", 3);
  for (const auto& [group, subgroup] :
       std::vector<std::pair<std::optional<std::string>, std::optional<std::string>>>{
           {"Haptics", "Stats"},
           {"QuorvexAE2MCA", std::nullopt},
           {std::nullopt, "MCA"},
           {"Speaker", "Nope"},
           {"Speaker/temperature", std::nullopt}}) {
    OptionalError error;
    auto channels = service.CopyChannelsInGroup(group, subgroup, 0, &error);
    EXPECT_FALSE(error);
    ASSERT_TRUE(channels);
    EXPECT_EQ(service.ChannelCount(*channels), 0) << group.value_or("-");
  }
}

TEST_F(CountersTreeDriverStatsTest, NamesThatWouldLeaveTheRootMatchNothing) {
  tree.write("G/c", 1);
  // <outside> is a sibling of the root: "../outside" must not reach it.
  ::mkdir((tree.outside() + "/c").c_str(), 0755);
  std::ofstream(tree.outside() + "/x") << "1\n";
  for (const auto& [group, subgroup] :
       std::vector<std::pair<std::optional<std::string>, std::optional<std::string>>>{
           {"..", std::nullopt},
           {"../outside", std::nullopt},
           {".", std::nullopt},
           {"G", ".."},
           {"", std::nullopt},
           {std::nullopt, ".."},
           {"/", std::nullopt}}) {
    OptionalError error;
    auto channels = service.CopyChannelsInGroup(group, subgroup, 0, &error);
    ASSERT_TRUE(channels);
    EXPECT_EQ(service.ChannelCount(*channels), 0)
        << group.value_or("-") << " " << subgroup.value_or("-");
  }
}

TEST_F(CountersTreeDriverStatsTest, LinksInsideTheRootAreFollowedLinksOutAreIgnored) {
  tree.write("PipeWire/alsa_output.card0/xruns", 12);
  tree.link("PipeWire/alsa_output.card0", "Speaker");                   // group alias, relative
  tree.link(tree.path("PipeWire/alsa_output.card0/xruns"), "G/xruns");  // channel alias, absolute
  std::ofstream(tree.outside() + "/secret") << "1234\n";
  ::mkdir((tree.outside() + "/grp").c_str(), 0755);
  std::ofstream(tree.outside() + "/grp/c") << "5\n";
  tree.link(tree.outside() + "/secret", "G/secret");
  tree.link("../../outside/secret", "G/relative-secret");
  tree.link(tree.outside() + "/grp", "Escaped");
  tree.link(tree.outside() + "/grp", "G/EscapedSub");
  tree.link("/nonexistent/x", "G/dangling");

  OptionalError error;
  auto speaker = service.CopyChannelsInGroup("Speaker", std::nullopt, 0, &error);
  ASSERT_TRUE(speaker);
  EXPECT_EQ(Rows(*speaker), (std::vector<ChannelRow>{{"Speaker", "", "xruns", "Speaker/xruns"}}));
  auto g = service.CopyChannelsInGroup("G", std::nullopt, 0, &error);
  ASSERT_TRUE(g);
  EXPECT_EQ(Rows(*g), (std::vector<ChannelRow>{{"G", "", "xruns", "G/xruns"}}));
  auto escaped = service.CopyChannelsInGroup("Escaped", std::nullopt, 0, &error);
  ASSERT_TRUE(escaped);
  EXPECT_EQ(service.ChannelCount(*escaped), 0);
  EXPECT_FALSE(error);
  EXPECT_TRUE(log.Contains("G/secret: the link leads out of the counters tree"));

  DriverChannels subscribed;
  const auto handle = Subscribe("Speaker", std::nullopt, &subscribed);
  EXPECT_EQ(Sample(handle, subscribed), (std::map<std::string, int64_t>{{"xruns", 12}}));
}

TEST_F(CountersTreeDriverStatsTest, EverySampleReadsTheFileAfreshAfterAtomicReplacement) {
  tree.write("G/a", 10);
  tree.write("G/b", 20);
  DriverChannels subscribed;
  const auto handle = Subscribe("G", std::nullopt, &subscribed);
  ASSERT_NE(handle, 0u);
  EXPECT_EQ(Sample(handle, subscribed), (std::map<std::string, int64_t>{{"a", 10}, {"b", 20}}));
  tree.write("G/a", 11);  // rename over the old file: a kept descriptor would still see 10
  EXPECT_EQ(Sample(handle, subscribed), (std::map<std::string, int64_t>{{"a", 11}, {"b", 20}}));
  tree.write("G/c", 30);  // channels added later are not in this subscription
  EXPECT_EQ(Sample(handle, subscribed).count("c"), 0u);
}

TEST_F(CountersTreeDriverStatsTest, BadChannelFilesAreSkippedWithAnErrorLineAndCostOnlyThemselves) {
  tree.write("G/good", 7);
  tree.write("G/vanishing", 1);
  tree.write("G/garbage", "twelve\n");
  tree.write("G/overflow", "9223372036854775808\n");
  tree.write("G/empty", "");
  tree.write("G/long", std::string(200, '1'));
  tree.write("G/becomes-dir", 1);
  tree.write("G/becomes-fifo", 1);
  DriverChannels subscribed;
  const auto handle = Subscribe("G", std::nullopt, &subscribed);
  ASSERT_EQ(service.ChannelCount(subscribed), 8);

  tree.remove("G/vanishing");
  tree.remove("G/becomes-dir");
  tree.makeDirectory("G/becomes-dir");
  tree.remove("G/becomes-fifo");
  ASSERT_EQ(::mkfifo(tree.path("G/becomes-fifo").c_str(), 0644), 0);  // must not block
  log.Clear();
  EXPECT_EQ(Sample(handle, subscribed), (std::map<std::string, int64_t>{{"good", 7}}));

  EXPECT_EQ(log.Count("skipping channel file", LogLevel::kError), 7u);
  EXPECT_TRUE(log.Contains(tree.root() + "/G/vanishing: No such file or directory"));
  EXPECT_TRUE(log.Contains("G/garbage: not one signed 64-bit decimal integer"));
  EXPECT_TRUE(log.Contains("G/overflow: not one signed 64-bit decimal integer"));
  EXPECT_TRUE(log.Contains("G/empty: empty"));
  EXPECT_TRUE(log.Contains("G/long: longer than 64 bytes"));
  EXPECT_TRUE(log.Contains("G/becomes-dir: not a regular file"));
  EXPECT_TRUE(log.Contains("G/becomes-fifo: not a regular file"));
  EXPECT_EQ(service.drops().unreadableChannels, 7u);

  tree.write("G/garbage", 3);  // repaired: read again on the next sample
  EXPECT_EQ(Sample(handle, subscribed).at("garbage"), 3);
}

TEST_F(CountersTreeDriverStatsTest, RootRemovedAfterSubscribingIsAnErrorOfCreateSamples) {
  tree.write("G/a", 1);
  DriverChannels subscribed;
  const auto handle = Subscribe("G", std::nullopt, &subscribed);
  tree.remove("");
  OptionalError error;
  EXPECT_EQ(service.CreateSamples(handle, subscribed, &error), std::nullopt);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, ENOENT);
}

TEST_F(CountersTreeDriverStatsTest, TamperedChannelPathsNeverReadOutsideTheRoot) {
  tree.write("G/a", 1);
  std::ofstream(tree.outside() + "/x") << "1234\n";
  const DriverChannels tampered{
      {"channels",
       {{{"group", "G"}, {"subgroup", nullptr}, {"name", "a"}, {"path", "G/a"}},
        {{"group", "G"}, {"subgroup", nullptr}, {"name", "x"}, {"path", "../outside/x"}},
        {{"group", "G"}, {"subgroup", nullptr}, {"name", "y"}, {"path", tree.outside() + "/x"}},
        {{"group", "G"}, {"subgroup", nullptr}, {"name", "z"}, {"path", "G/./a"}},
        {{"group", "G"}, {"name", "no path"}}}}};
  DriverChannels subscribed;
  const auto handle = service.CreateSubscription(tampered, &subscribed, 0);
  ASSERT_NE(handle, 0u);
  EXPECT_EQ(service.ChannelCount(subscribed), 1);  // the others are refused at subscription
  EXPECT_EQ(log.Count("not subscribing to malformed channel", LogLevel::kError), 4u);
  // And if they are put back into the subscribed description, sampling refuses them too.
  OptionalError error;
  auto samples = service.CreateSamples(handle, tampered, &error);
  EXPECT_FALSE(error);
  ASSERT_TRUE(samples);
  EXPECT_EQ(Values(service, *samples), (std::map<std::string, int64_t>{{"a", 1}}));
  EXPECT_EQ(log.Count("not a path inside the counters tree", LogLevel::kError), 3u);
}

TEST_F(CountersTreeDriverStatsTest, DeltaMatchesByFileCountsNewChannelsFromZeroAndDropsGoneOnes) {
  tree.write("G/a", 10);
  tree.write("G/S/a", 100);  // same name, other file
  tree.write("G/gone", 5);
  DriverChannels subscribed;
  const auto handle = Subscribe("G", std::nullopt, &subscribed);
  OptionalError error;
  const auto before = service.CreateSamples(handle, subscribed, &error);
  ASSERT_TRUE(before);

  tree.write("G/a", 15);
  tree.write("G/S/a", 90);
  tree.remove("G/gone");
  tree.write("G/new", 4);
  DriverChannels resubscribed;
  const auto handle2 = Subscribe("G", std::nullopt, &resubscribed);
  const auto after = service.CreateSamples(handle2, resubscribed, &error);
  ASSERT_TRUE(after);
  const auto delta = service.CreateSamplesDelta(&*before, *after, &error);
  EXPECT_FALSE(error);
  ASSERT_TRUE(delta);
  std::vector<std::pair<std::string, int64_t>> rows;
  for (const auto& sample : delta->at("samples")) {
    rows.emplace_back(sample.at("path").get<std::string>(), sample.at("value").get<int64_t>());
  }
  EXPECT_EQ(rows, (std::vector<std::pair<std::string, int64_t>>{
                      {"G/a", 5}, {"G/new", 4}, {"G/S/a", -10}}));

  const auto absolute = service.CreateSamplesDelta(nullptr, *after, &error);
  ASSERT_TRUE(absolute);
  EXPECT_EQ(*absolute, *after);
}

TEST_F(CountersTreeDriverStatsTest, DeltaRejectsMalformedSetsAndSkipsOverflow) {
  OptionalError error;
  const DriverSampleSet current{{"samples", {{{"name", "a"}, {"path", "G/a"}, {"value", 1}}}}};
  EXPECT_EQ(service.CreateSamplesDelta(nullptr, Value{{"x", 1}}, &error), std::nullopt);
  EXPECT_EQ(error->code, EINVAL);
  error.reset();
  const Value notASet = Value::array();
  EXPECT_EQ(service.CreateSamplesDelta(&notASet, current, &error), std::nullopt);
  EXPECT_EQ(error->code, EINVAL);

  error.reset();
  const DriverSampleSet low{{"samples",
                             {{{"name", "a"}, {"path", "G/a"}, {"value", INT64_MIN}},
                              {{"name", "b"}, {"path", "G/b"}, {"value", 1}}}}};
  const DriverSampleSet high{{"samples",
                              {{{"name", "a"}, {"path", "G/a"}, {"value", INT64_MAX}},
                               {{"name", "b"}, {"path", "G/b"}, {"value", 3}}}}};
  const auto delta = service.CreateSamplesDelta(&low, high, &error);
  EXPECT_FALSE(error);
  ASSERT_TRUE(delta);
  EXPECT_EQ(Values(service, *delta), (std::map<std::string, int64_t>{{"b", 2}}));
  EXPECT_EQ(service.drops().overflowedDeltas, 1u);
  EXPECT_EQ(log.Count("does not fit 64 bits", LogLevel::kError), 1u);
}

// Writers replace files by rename while the service samples from several threads: every sample
// sees a whole old or a whole new value, never a torn or missing one.
TEST_F(CountersTreeDriverStatsTest, ConcurrentSamplingDuringReplacementNeverSeesTornValues) {
  tree.write("G/counter", 0);
  DriverChannels subscribed;
  const auto handle = Subscribe("G", std::nullopt, &subscribed);
  std::atomic<bool> stop{false};
  std::thread writer([&] {
    for (int i = 1; i <= 300; ++i) tree.write("G/counter", 1000000000LL * i);
    stop = true;
  });
  std::atomic<int> bad{0};
  auto reader = [&] {
    while (!stop) {
      OptionalError error;
      auto samples = service.CreateSamples(handle, subscribed, &error);
      const auto values = samples ? Values(service, *samples) : std::map<std::string, int64_t>{};
      if (error || values.size() != 1 || values.begin()->second % 1000000000LL != 0) ++bad;
    }
  };
  std::thread r1(reader), r2(reader);
  writer.join();
  r1.join();
  r2.join();
  EXPECT_EQ(bad.load(), 0);
  EXPECT_EQ(service.drops().unreadableChannels, 0u);
}

}  // namespace
}  // namespace tavrin
