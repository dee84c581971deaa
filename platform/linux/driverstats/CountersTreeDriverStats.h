#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "platform/DriverStatsService.h"
#include "platform/LogSystem.h"

namespace tavrin {

// DriverStatsService over a counters tree: plain files that drivers (or an exporter such as
// tools/tavrin-pw-exporter) keep current, and that this class only reads.
//
// Tree layout (docs/driver-statistics.md has the long form):
//   <root>/<group>/<channel>              a channel of group <group>, without subgroup
//   <root>/<group>/<subgroup>/<channel>   a channel of subgroup <subgroup> of group <group>
// A channel is a regular file holding one decimal signed 64-bit integer, optionally surrounded by
// ASCII white space ("42\n"). Its name is the file name.
//
// Rules for entries of the tree:
//  - Names beginning with '.' are ignored at every level: writers create their temporary files
//    with a leading dot next to the counter and rename them over it, so a half-written file is
//    never seen as a channel. ("." and ".." fall under the same rule.)
//  - Symbolic links are followed only when the resolved target lies inside the root; a link that
//    leads out of the root (or nowhere) is ignored. So a group "Speaker" may be a link to
//    "PipeWire/alsa_output.pci-0000_00_1f.3.analog-stereo".
//  - Directories below <subgroup> and entries that are neither regular files nor directories
//    (FIFOs, sockets, devices) are ignored; a channel is never opened in a way that could block.
//
// Matching (CopyChannelsInGroup): a channel matches when its group equals `group` and its subgroup
// equals `subgroup`, an absent name matching anything, including "no subgroup". So (G, none) gives
// G's own channels and those of all its subgroups; (none, "MCA") gives subgroup MCA of every
// group; (none, none) gives the whole tree. Order: groups by name; in a group its own channels by
// name, then its subgroups by name, each with its channels by name.
//
// Channel description (DriverChannels) layout:
//   {"channels": [{"group": "G", "subgroup": "S" | null, "name": "N", "path": "G/S/N"}, ...]}
// "path" is relative to the root and is what CreateSamples reads.
//
// Pending queries: a query that finds no channel (the root is missing, or nothing matches yet)
// describes itself instead, {"channels": [], "pending": {"group": G | null, "subgroup": S | null}},
// and ChannelCount counts it as one channel, so the caller subscribes to it. Every CreateSamples
// of such a subscription runs the query again: drivers or the exporter that start after the
// service are seen without a restart. While the root is still missing it samples nothing, without
// an error. A query whose names cannot be tree names ("..") never matches and is not pending.
// CopyChannelsInGroup still reports a root it cannot list as an error, with the pending
// description.
//
// Sample set (DriverSampleSet) layout:
//   {"samples": [{"name": "N", "path": "G/S/N", "value": 42}, ...]}
// CreateSamplesDelta matches samples by "path" (by "name" when a sample has no path); a channel
// absent from the earlier set counts from 0, so its delta is its current value; a channel
// present only in the earlier set has no delta.
//
// Errors: Error{kDriverStatsErrorDomain, code, description}; codes are errno values:
//   ENOENT / ENOTDIR / EACCES / ...  the root (or a directory below it) could not be listed (or,
//               from CreateSamples of channels found earlier, the root has gone);
//   EINVAL      a subscription handle this service did not issue, or a channel description or
//               sample set that does not have the layout above.
// A directory below the root that cannot be listed is skipped: CopyChannelsInGroup then returns
// the channels it did find *and* the error of the first such directory. A channel file that is
// missing, unreadable, not a regular file, or holds anything but one in-range integer is left out
// of its sample set with an error line naming the file; that is not an error of CreateSamples, so
// one bad file does not cost its neighbours. Likewise a difference that does not fit 64 bits is
// left out of the delta set with an error line.
//
// Thread-safe: it holds no mutable state except counters, and every read opens the file afresh
// (exporters replace files by rename; a descriptor kept open would keep reading the old file).
class CountersTreeDriverStats final : public DriverStatsService {
 public:
  // `root` need not exist yet; each operation looks at it anew. Lines go to `log` (the default
  // system log when null).
  explicit CountersTreeDriverStats(std::string root, LogHandle log = nullptr);

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

  const std::string& root() const { return root_; }

  // What was left out, for people reading a status line or a test.
  struct Drops {
    uint64_t unreadableChannels = 0;  // channel files skipped by CreateSamples
    uint64_t ignoredEntries = 0;      // tree entries ignored by the rules above (dotfiles excluded)
    uint64_t truncatedQueries = 0;    // queries that hit kMaxChannelsPerQuery
    uint64_t overflowedDeltas = 0;    // differences that did not fit 64 bits
  };
  Drops drops() const;

  // One query describes at most this many channels: a real driver exports tens of counters, and
  // the bound keeps a runaway writer from making every session start read thousands of files.
  static constexpr size_t kMaxChannelsPerQuery = 4096;
  // A channel file longer than this is not one integer ("-9223372036854775808" is 20 bytes);
  // reading stops here so a stray large file costs nothing.
  static constexpr size_t kMaxChannelFileBytes = 64;

 private:
  struct Listing;
  void ListGroup(Listing& listing, const std::string& group,
                 const std::optional<std::string>& subgroup) const;
  void ListChannels(Listing& listing, const std::string& group,
                    const std::optional<std::string>& subgroup, const std::string& relDir) const;
  // Resolves `rel` below the root; nullopt (and errno set) when it does not exist or leads out.
  std::optional<std::string> ResolveInside(const std::string& canonicalRoot,
                                           const std::string& rel) const;
  // Lists (group, subgroup) into `listing`; false with *error set when the root cannot be listed.
  bool List(Listing& listing, const std::optional<std::string>& group,
            const std::optional<std::string>& subgroup, OptionalError* error) const;
  std::optional<int64_t> ReadChannel(const std::string& canonicalRoot, const std::string& rel,
                                     std::string* why) const;

  const std::string root_;
  const LogHandle log_;
  std::atomic<DriverSubscription> nextSubscription_{1};
  mutable std::atomic<uint64_t> unreadableChannels_{0};
  mutable std::atomic<uint64_t> ignoredEntries_{0};
  mutable std::atomic<uint64_t> truncatedQueries_{0};
  mutable std::atomic<uint64_t> overflowedDeltas_{0};
};

inline constexpr const char* kDriverStatsErrorDomain = "com.quorvex.tavrin.driverstats";

// Parses the contents of a channel file: one decimal signed 64-bit integer with optional ASCII
// white space around it. nullopt for anything else (empty, garbage, out of range).
std::optional<int64_t> ParseCounterText(std::string_view text);

}  // namespace tavrin
