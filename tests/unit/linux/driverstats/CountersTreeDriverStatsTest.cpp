#include "platform/linux/driverstats/CountersTreeDriverStats.h"

#include <sys/stat.h>

#include <cerrno>
#include <map>

#include <gtest/gtest.h>

#include "tests/fakes/FakeLogSystem.h"
#include "tests/support/TempCountersTree.h"

namespace tavrin {
namespace {

using Rows = std::vector<std::string>;
using Values = std::map<std::string, int64_t>;

TEST(ParseCounterTextTest, OneSigned64BitIntegerWithWhiteSpaceAroundAndNothingElse) {
  EXPECT_EQ(ParseCounterText("42"), 42);
  EXPECT_EQ(ParseCounterText("  -7\n"), -7);
  EXPECT_EQ(ParseCounterText("0\r\n"), 0);
  EXPECT_EQ(ParseCounterText("9223372036854775807"), INT64_MAX);
  EXPECT_EQ(ParseCounterText("-9223372036854775808"), INT64_MIN);
  EXPECT_EQ(ParseCounterText(std::string_view("1\0", 2)), std::nullopt);
  for (const char* text : {"", " \n", "12abc", "abc", "1.5", "0x10", "1 2", "+5", "--1", "-",
                           "9223372036854775808", "-9223372036854775809", "99999999999999999999"}) {
    EXPECT_EQ(ParseCounterText(text), std::nullopt) << '"' << text << '"';
  }
}

class CountersTreeDriverStatsTest : public ::testing::Test {
 protected:
  // "group/subgroup/name=path" of each channel of GROUP/SUBGROUP ("*" matches any).
  Rows Channels(const std::string& group, const std::string& subgroup = "*") {
    auto name = [](const std::string& n) { return n == "*" ? std::nullopt : std::optional(n); };
    OptionalError error;
    const auto channels = service_.CopyChannelsInGroup(name(group), name(subgroup), 0, &error);
    EXPECT_FALSE(error) << error->description;
    Rows rows;
    for (const auto& c : channels ? channels->at("channels") : Value::array()) {
      rows.push_back(c["group"].get<std::string>() + "/" +
                     (c["subgroup"].is_null() ? "" : c["subgroup"].get<std::string>()) + "/" +
                     c["name"].get<std::string>() + "=" + c["path"].get<std::string>());
    }
    return rows;
  }
  void Subscribe(const std::string& group) {
    OptionalError error;
    const auto channels = service_.CopyChannelsInGroup(group, std::nullopt, 0, &error);
    ASSERT_TRUE(channels);
    handle_ = service_.CreateSubscription(*channels, &subscribed_, 0);
    ASSERT_NE(handle_, 0u);
  }
  std::optional<DriverSampleSet> Samples(OptionalError* error = nullptr) {
    OptionalError ignored;
    return service_.CreateSamples(handle_, subscribed_, error ? error : &ignored);
  }
  // name -> value of every sample, through the service's own accessors.
  Values Read(const std::optional<DriverSampleSet>& set) {
    Values values;
    service_.IterateSamples(set.value_or(Value::object()), [&](const DriverSample& sample) {
      values[service_.SampleChannelName(sample).value_or("?")] =
          service_.SampleIntegerValue(sample);
      return 0;
    });
    return values;
  }

  testing::FakeLogSystem log_;
  testing::TempCountersTree tree_;
  CountersTreeDriverStats service_{tree_.root()};
  DriverSubscription handle_ = 0;
  DriverChannels subscribed_;
};

// Groups and subgroups come in name order, a group's own channels first. Dot names (a writer's
// temporary file) and files below a subgroup are never channels, and names that would leave the
// root match nothing.
TEST_F(CountersTreeDriverStatsTest, AbsentNamesMatchAnyAndNoNameLeavesTheRoot) {
  for (auto rel : {"Speaker/temperature", "Speaker/MCA/resets", "Other/MCA/resets",
                   "Haptics/Stats/kicks", "Haptics/clicks", "Haptics/Other/hums", ".hidden/c",
                   "Haptics/Stats/Deep/x"}) {  // below a subgroup: never a channel
    tree_.write(rel, 1);
  }
  std::ofstream(tree_.path("Haptics/.clicks.tmp")) << "1\n";
  std::ofstream(tree_.outside() + "/x") << "1\n";  // a sibling of the root: "../outside/x"
  EXPECT_EQ(Channels("Haptics"),
            (Rows{"Haptics//clicks=Haptics/clicks", "Haptics/Other/hums=Haptics/Other/hums",
                  "Haptics/Stats/kicks=Haptics/Stats/kicks"}));
  EXPECT_EQ(Channels("*", "MCA"),
            (Rows{"Other/MCA/resets=Other/MCA/resets", "Speaker/MCA/resets=Speaker/MCA/resets"}));
  EXPECT_EQ(Channels("*").size(), 6u);
  for (auto [group, subgroup] : {std::pair{"Haptics", "Nope"},
                                 {"Nope", "*"},
                                 {"Speaker/MCA", "*"},
                                 {"..", "*"},
                                 {"../outside", "*"},
                                 {".", "*"},
                                 {"Speaker", ".."},
                                 {"", "*"},
                                 {"*", ".."},
                                 {"/", "*"},
                                 {".hidden", "*"}}) {
    EXPECT_EQ(Channels(group, subgroup), Rows{}) << group << " " << subgroup;
  }
}

TEST_F(CountersTreeDriverStatsTest, LinksInsideTheRootAreFollowedLinksOutAreIgnored) {
  tree_.write("PipeWire/alsa_output.card0/xruns", 12);
  tree_.link("PipeWire/alsa_output.card0", "Speaker");                    // group alias, relative
  tree_.link(tree_.path("PipeWire/alsa_output.card0/xruns"), "G/xruns");  // channel, absolute
  std::ofstream(tree_.outside() + "/secret") << "1234\n";
  tree_.link(tree_.outside() + "/secret", "G/secret");
  tree_.link("../../outside/secret", "G/relative-secret");
  tree_.link(tree_.outside(), "G/EscapedSub");
  tree_.link("/nonexistent/x", "G/dangling");
  EXPECT_EQ(Channels("Speaker"), (Rows{"Speaker//xruns=Speaker/xruns"}));
  EXPECT_EQ(Channels("G"), (Rows{"G//xruns=G/xruns"}));
  EXPECT_TRUE(log_.Contains("G/secret: the link leads out of the counters tree"));
  Subscribe("Speaker");
  EXPECT_EQ(Read(Samples()), (Values{{"xruns", 12}}));
}

// A file that is missing, not a regular file, or holds anything but one in-range integer is left
// out with an error line naming it; it costs only itself, and is read again next time.
TEST_F(CountersTreeDriverStatsTest, EverySampleReadsTheFilesAfreshAndBadOnesCostOnlyThemselves) {
  for (auto rel : {"G/good", "G/vanishing", "G/becomes-dir", "G/becomes-fifo"}) tree_.write(rel, 7);
  tree_.write("G/garbage", "twelve\n");
  tree_.write("G/overflow", "9223372036854775808\n");
  tree_.write("G/empty", "");
  tree_.write("G/long", std::string(200, '1'));
  Subscribe("G");
  tree_.write("G/good", 11);  // renamed over the old file: a kept descriptor would still see 7
  tree_.write("G/new", 30);   // channels added later are not in this subscription
  tree_.remove("G/vanishing");
  tree_.remove("G/becomes-dir");
  std::filesystem::create_directory(tree_.path("G/becomes-dir"));
  tree_.remove("G/becomes-fifo");
  ASSERT_EQ(mkfifo(tree_.path("G/becomes-fifo").c_str(), 0644), 0);  // must not block
  EXPECT_EQ(Read(Samples()), (Values{{"good", 11}}));
  EXPECT_EQ(log_.Count("skipping channel file", LogLevel::kError), 7u);
  for (auto why : {"G/vanishing: No such file or directory", "G/empty: empty",
                   "G/garbage: not one signed 64-bit decimal integer", "G/long: longer than 64",
                   "G/overflow: not one signed", "G/becomes-dir: not a regular file",
                   "G/becomes-fifo: not a regular file"}) {
    EXPECT_TRUE(log_.Contains(why)) << why;
  }
  EXPECT_EQ(service_.drops().unreadableChannels, 7u);
  tree_.write("G/garbage", 3);
  EXPECT_EQ(Read(Samples()).at("garbage"), 3);
  OptionalError error;  // the root itself gone: an error of the call, with its errno
  tree_.remove("");
  EXPECT_FALSE(Samples(&error));
  EXPECT_EQ(error->code, ENOENT);
  EXPECT_EQ(error->domain, kDriverStatsErrorDomain);
}

// Samples match by file; a channel new since the earlier set counts from 0, one gone has no
// delta, and a difference beyond 64 bits is left out with an error line.
TEST_F(CountersTreeDriverStatsTest, DeltaMatchesByFileCountsNewChannelsFromZeroAndSkipsOverflow) {
  tree_.write("G/a", 10);
  tree_.write("G/S/a", 100);  // same name, other file
  tree_.write("G/gone", 5);
  Subscribe("G");
  const auto before = Samples();
  tree_.write("G/a", 15);
  tree_.write("G/S/a", 90);
  tree_.remove("G/gone");
  tree_.write("G/new", 4);
  Subscribe("G");
  const auto after = Samples();
  ASSERT_TRUE(before && after);
  OptionalError error;
  Rows rows;
  const auto delta = service_.CreateSamplesDelta(&*before, *after, &error);
  for (const auto& s : delta->at("samples")) {
    rows.push_back(s["path"].get<std::string>() + "=" + s["value"].dump());
  }
  EXPECT_EQ(rows, (Rows{"G/a=5", "G/new=4", "G/S/a=-10"}));
  EXPECT_EQ(service_.CreateSamplesDelta(nullptr, *after, &error), after);
  auto set = [](int64_t a, int64_t b) {
    return DriverSampleSet{{"samples",
                            {{{"name", "a"}, {"path", "G/a"}, {"value", a}},
                             {{"name", "b"}, {"path", "G/b"}, {"value", b}}}}};
  };
  const DriverSampleSet low = set(INT64_MIN, 1);
  EXPECT_EQ(Read(service_.CreateSamplesDelta(&low, set(INT64_MAX, 3), &error)), (Values{{"b", 2}}));
  EXPECT_FALSE(error);
  EXPECT_EQ(log_.Count("does not fit 64 bits", LogLevel::kError), 1u);
  EXPECT_FALSE(service_.CreateSamplesDelta(nullptr, Value{{"x", 1}}, &error));
  EXPECT_EQ(error->code, EINVAL);
}

// Packaged, the service may start before the drivers or the exporter made the tree: a query that
// found nothing is run again on each sample, so the tree is seen when it appears, without a restart
// and without an error while it is missing.
TEST_F(CountersTreeDriverStatsTest, AQueryThatFoundNothingSeesTheTreeWhenItAppears) {
  tree_.remove("");
  OptionalError error;
  const auto channels = service_.CopyChannelsInGroup("Speaker", std::nullopt, 0, &error);
  ASSERT_TRUE(channels && error);
  EXPECT_EQ(error->code, ENOENT);
  EXPECT_EQ(service_.ChannelCount(*channels), 1);
  handle_ = service_.CreateSubscription(*channels, &subscribed_, 0);
  error.reset();
  EXPECT_EQ(Read(Samples(&error)), Values{});
  EXPECT_FALSE(error);
  tree_.write("Speaker/MCA/resets", 2);  // makes the root
  tree_.write("Other/xruns", 9);         // not this query's group
  EXPECT_EQ(Read(Samples()), (Values{{"resets", 2}}));
  tree_.write("Speaker/xruns", 4);
  EXPECT_EQ(Read(Samples()), (Values{{"resets", 2}, {"xruns", 4}}));
  // A name that can never be in the tree is not worth looking for again.
  EXPECT_EQ(service_.ChannelCount(*service_.CopyChannelsInGroup("..", {}, 0, &error)), 0);
}

}  // namespace
}  // namespace tavrin
