#include "platform/linux/driverstats/CountersTreeDriverStats.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <unordered_map>
#include <vector>

namespace tavrin {
namespace {

constexpr std::string_view kWhiteSpace = " \t\n\r\v\f";

Error MakeError(int code, std::string description) {
  return Error{kDriverStatsErrorDomain, code, std::move(description)};
}

void SetError(OptionalError* error, int code, std::string description) {
  if (error != nullptr) *error = MakeError(code, std::move(description));
}

std::string ErrnoText(int code) { return std::strerror(code); }

// A name the tree may hold: not empty, no '/', not hidden (which also rules out "." and "..").
bool IsTreeName(std::string_view name) {
  return !name.empty() && name.front() != '.' && name.find('/') == std::string_view::npos &&
         name.find('\0') == std::string_view::npos;
}

// A relative path of one to three tree names, as CopyChannelsInGroup writes them.
bool IsChannelPath(std::string_view path) {
  int components = 0;
  size_t start = 0;
  while (true) {
    const size_t slash = path.find('/', start);
    const std::string_view part = path.substr(
        start, slash == std::string_view::npos ? std::string_view::npos : slash - start);
    if (!IsTreeName(part)) return false;
    ++components;
    if (slash == std::string_view::npos) break;
    start = slash + 1;
  }
  return components >= 2 && components <= 3;
}

std::optional<std::string> CanonicalPath(const std::string& path) {
  char* resolved = ::realpath(path.c_str(), nullptr);
  if (resolved == nullptr) return std::nullopt;
  std::string result(resolved);
  std::free(resolved);
  return result;
}

bool IsInside(const std::string& canonicalRoot, const std::string& resolved) {
  if (canonicalRoot == "/") return true;
  return resolved.size() > canonicalRoot.size() &&
         resolved.compare(0, canonicalRoot.size(), canonicalRoot) == 0 &&
         resolved[canonicalRoot.size()] == '/';
}

// A name that cannot be a tree entry matches nothing (and must not be looked up: "..").
bool NamePossible(const std::optional<std::string>& name) { return !name || IsTreeName(*name); }

bool CanMatch(const std::optional<std::string>& group, const std::optional<std::string>& subgroup) {
  return NamePossible(group) && NamePossible(subgroup);
}

// The query of a pending channel description, when it is one: (group, subgroup), each a string
// or null.
std::optional<std::pair<std::optional<std::string>, std::optional<std::string>>> PendingQuery(
    const Value& channels) {
  if (!channels.is_object()) return std::nullopt;
  const auto it = channels.find("pending");
  if (it == channels.end() || !it->is_object()) return std::nullopt;
  std::optional<std::string> names[2];
  int i = 0;
  for (const char* key : {"group", "subgroup"}) {
    const auto name = it->find(key);
    if (name == it->end() || !(name->is_null() || name->is_string())) return std::nullopt;
    if (name->is_string()) names[i] = name->get<std::string>();
    ++i;
  }
  return std::pair{names[0], names[1]};
}

// The value of one sample entry, when it is a signed 64-bit integer.
std::optional<int64_t> EntryValue(const Value& entry) {
  const auto it = entry.find("value");
  if (it == entry.end()) return std::nullopt;
  if (it->is_number_unsigned()) {
    const auto value = it->get<uint64_t>();
    if (value > uint64_t(INT64_MAX)) return std::nullopt;
    return int64_t(value);
  }
  if (it->is_number_integer()) return it->get<int64_t>();
  return std::nullopt;
}

// The array under `key` of a dictionary in one of this service's layouts, or null.
const Value* ArrayOf(const Value& dictionary, const char* key) {
  if (!dictionary.is_object()) return nullptr;
  const auto it = dictionary.find(key);
  if (it == dictionary.end() || !it->is_array()) return nullptr;
  return &*it;
}

const std::string* StringField(const Value& entry, const char* key) {
  if (!entry.is_object()) return nullptr;
  const auto it = entry.find(key);
  if (it == entry.end() || !it->is_string()) return nullptr;
  return &it->get_ref<const std::string&>();
}

// Samples are matched across sets by their file, or by their name when they carry no path.
std::optional<std::string> SampleIdentity(const Value& entry) {
  if (const std::string* path = StringField(entry, "path")) return "p:" + *path;
  if (const std::string* name = StringField(entry, "name")) return "n:" + *name;
  return std::nullopt;
}

}  // namespace

std::optional<int64_t> ParseCounterText(std::string_view text) {
  const size_t first = text.find_first_not_of(kWhiteSpace);
  if (first == std::string_view::npos) return std::nullopt;
  const size_t last = text.find_last_not_of(kWhiteSpace);
  const std::string_view digits = text.substr(first, last - first + 1);
  int64_t value = 0;
  const auto [end, ec] = std::from_chars(digits.data(), digits.data() + digits.size(), value, 10);
  if (ec != std::errc() || end != digits.data() + digits.size()) return std::nullopt;
  return value;
}

struct CountersTreeDriverStats::Listing {
  std::string canonicalRoot;
  Value channels = Value::array();
  OptionalError firstError;
  bool truncated = false;

  void Fail(int code, const std::string& what) {
    if (!firstError) firstError = MakeError(code, what + ": " + ErrnoText(code));
  }
};

namespace {

enum class EntryKind { kFile, kDirectory };

struct TreeEntry {
  std::string name;
  EntryKind kind;
};

}  // namespace

CountersTreeDriverStats::CountersTreeDriverStats(std::string root, LogHandle log)
    : root_(std::move(root)), log_(std::move(log)) {}

std::optional<std::string> CountersTreeDriverStats::ResolveInside(const std::string& canonicalRoot,
                                                                  const std::string& rel) const {
  auto resolved = CanonicalPath(canonicalRoot + "/" + rel);
  if (!resolved) return std::nullopt;
  if (!IsInside(canonicalRoot, *resolved)) {
    errno = EXDEV;
    return std::nullopt;
  }
  return resolved;
}

namespace {

// The entries of directory `rel` (relative to the root) that the tree rules admit, sorted by name.
// Returns false with errno set when the directory cannot be listed.
bool ReadTreeDirectory(const std::string& canonicalRoot, const std::string& rel,
                       std::vector<TreeEntry>* entries, uint64_t* ignored,
                       std::vector<std::string>* linksOut) {
  const std::string dirPath = rel.empty() ? canonicalRoot : canonicalRoot + "/" + rel;
  DIR* dir = ::opendir(dirPath.c_str());
  if (dir == nullptr) return false;
  while (true) {
    errno = 0;
    const dirent* entry = ::readdir(dir);
    if (entry == nullptr) break;
    const std::string name = entry->d_name;
    if (!IsTreeName(name)) continue;  // dotfiles: writers' temporary files, "." and ".."
    const std::string full = dirPath + "/" + name;
    struct stat info {};
    if (::lstat(full.c_str(), &info) != 0) continue;  // gone since readdir: nothing to list
    if (S_ISLNK(info.st_mode)) {
      const auto target = CanonicalPath(full);
      if (!target || !IsInside(canonicalRoot, *target) || ::stat(target->c_str(), &info) != 0) {
        ++*ignored;
        linksOut->push_back(rel.empty() ? name : rel + "/" + name);
        continue;
      }
    }
    if (S_ISREG(info.st_mode)) {
      entries->push_back({name, EntryKind::kFile});
    } else if (S_ISDIR(info.st_mode)) {
      entries->push_back({name, EntryKind::kDirectory});
    } else {
      ++*ignored;
    }
  }
  const int readError = errno;
  ::closedir(dir);
  std::sort(entries->begin(), entries->end(),
            [](const TreeEntry& a, const TreeEntry& b) { return a.name < b.name; });
  if (readError != 0) {
    errno = readError;
    return false;
  }
  return true;
}

}  // namespace

void CountersTreeDriverStats::ListChannels(Listing& listing, const std::string& group,
                                           const std::optional<std::string>& subgroup,
                                           const std::string& relDir) const {
  std::vector<TreeEntry> entries;
  uint64_t ignored = 0;
  std::vector<std::string> linksOut;
  if (!ReadTreeDirectory(listing.canonicalRoot, relDir, &entries, &ignored, &linksOut)) {
    const int code = errno;
    TLOG_ERROR(log_, "cannot list {}/{}: {}", root_, relDir, ErrnoText(code));
    listing.Fail(code, "cannot list " + relDir);
    return;
  }
  for (const auto& link : linksOut) {
    TLOG_DEFAULT(log_, "ignoring {}/{}: the link leads out of the counters tree", root_, link);
  }
  for (const auto& entry : entries) {
    if (entry.kind != EntryKind::kFile) {
      ++ignored;  // deeper than <group>/<subgroup>/<channel>
      continue;
    }
    if (listing.channels.size() >= kMaxChannelsPerQuery) {
      listing.truncated = true;
      break;
    }
    listing.channels.push_back(Value{{"group", group},
                                     {"subgroup", subgroup ? Value(*subgroup) : Value(nullptr)},
                                     {"name", entry.name},
                                     {"path", relDir + "/" + entry.name}});
  }
  ignoredEntries_ += ignored;
}

void CountersTreeDriverStats::ListGroup(Listing& listing, const std::string& group,
                                        const std::optional<std::string>& subgroup) const {
  std::vector<TreeEntry> entries;
  uint64_t ignored = 0;
  std::vector<std::string> linksOut;
  if (!ReadTreeDirectory(listing.canonicalRoot, group, &entries, &ignored, &linksOut)) {
    const int code = errno;
    TLOG_ERROR(log_, "cannot list {}/{}: {}", root_, group, ErrnoText(code));
    listing.Fail(code, "cannot list " + group);
    return;
  }
  ignoredEntries_ += ignored;
  for (const auto& link : linksOut) {
    TLOG_DEFAULT(log_, "ignoring {}/{}: the link leads out of the counters tree", root_, link);
  }
  // The group's own channels first, then its subgroups, each part in name order.
  if (!subgroup) {
    for (const auto& entry : entries) {
      if (entry.kind != EntryKind::kFile) continue;
      if (listing.channels.size() >= kMaxChannelsPerQuery) {
        listing.truncated = true;
        return;
      }
      listing.channels.push_back(Value{{"group", group},
                                       {"subgroup", nullptr},
                                       {"name", entry.name},
                                       {"path", group + "/" + entry.name}});
    }
  }
  for (const auto& entry : entries) {
    if (entry.kind != EntryKind::kDirectory) continue;
    if (subgroup && entry.name != *subgroup) continue;
    ListChannels(listing, group, entry.name, group + "/" + entry.name);
    if (listing.truncated) return;
  }
}

bool CountersTreeDriverStats::List(Listing& listing, const std::optional<std::string>& group,
                                   const std::optional<std::string>& subgroup,
                                   OptionalError* error) const {
  struct stat info {};
  auto canonical = CanonicalPath(root_);
  if (!canonical || ::stat(canonical->c_str(), &info) != 0) {
    const int code = errno;
    SetError(error, code, "counters tree " + root_ + ": " + ErrnoText(code));
    return false;
  }
  if (!S_ISDIR(info.st_mode)) {
    SetError(error, ENOTDIR, "counters tree " + root_ + ": " + ErrnoText(ENOTDIR));
    return false;
  }
  listing.canonicalRoot = *canonical;
  if (!CanMatch(group, subgroup)) return true;
  if (group) {
    // Only a directory inside the root is a group; anything else means "no such group".
    const auto resolved = ResolveInside(listing.canonicalRoot, *group);
    if (resolved && ::stat(resolved->c_str(), &info) == 0 && S_ISDIR(info.st_mode)) {
      ListGroup(listing, *group, subgroup);
    }
    return true;
  }
  std::vector<TreeEntry> groups;
  uint64_t ignored = 0;
  std::vector<std::string> linksOut;
  if (!ReadTreeDirectory(listing.canonicalRoot, "", &groups, &ignored, &linksOut)) {
    const int code = errno;
    SetError(error, code, "counters tree " + root_ + ": " + ErrnoText(code));
    return false;
  }
  for (const auto& link : linksOut) {
    TLOG_DEFAULT(log_, "ignoring {}/{}: the link leads out of the counters tree", root_, link);
  }
  for (const auto& entry : groups) {
    if (entry.kind != EntryKind::kDirectory) {
      ++ignored;  // a file directly under the root belongs to no group
      continue;
    }
    ListGroup(listing, entry.name, subgroup);
    if (listing.truncated) break;
  }
  ignoredEntries_ += ignored;
  return true;
}

std::optional<DriverChannels> CountersTreeDriverStats::CopyChannelsInGroup(
    const std::optional<std::string>& group, const std::optional<std::string>& subgroup,
    uint64_t options, OptionalError* error) {
  Listing listing;
  OptionalError rootError;
  const bool listed = List(listing, group, subgroup, &rootError);
  if (listing.truncated) {
    ++truncatedQueries_;
    TLOG_ERROR(log_, "channels of {}-{} in {}: only the first {} are used",
               group.value_or("(null)"), subgroup.value_or("(null)"), root_, kMaxChannelsPerQuery);
  }
  if (error != nullptr) *error = listed ? listing.firstError : rootError;
  DriverChannels result = MakeDictionary();
  // Nothing there yet (no tree, or no such group): the drivers or the exporter may start after
  // the service, so the query itself is kept and run again whenever it is sampled.
  if (listing.channels.empty() && CanMatch(group, subgroup)) {
    result["pending"] = Value{{"group", group ? Value(*group) : Value(nullptr)},
                              {"subgroup", subgroup ? Value(*subgroup) : Value(nullptr)}};
  }
  result["channels"] = std::move(listing.channels);
  return result;
}

int32_t CountersTreeDriverStats::ChannelCount(const DriverChannels& channels) {
  const Value* list = ArrayOf(channels, "channels");
  if (list == nullptr) return 0;
  // A pending query stands for the channels it will find: worth a subscription.
  if (list->empty() && PendingQuery(channels)) return 1;
  return int32_t(std::min<size_t>(list->size(), INT32_MAX));
}

DriverSubscription CountersTreeDriverStats::CreateSubscription(const DriverChannels& channels,
                                                               DriverChannels* subscribed,
                                                               uint64_t options) {
  const Value* list = ArrayOf(channels, "channels");
  if (list == nullptr) {
    if (subscribed != nullptr) *subscribed = DriverChannels{{"channels", Value::array()}};
    return 0;  // never issued: CreateSamples answers EINVAL for it
  }
  Value kept = Value::array();
  for (const auto& entry : *list) {
    const std::string* name = StringField(entry, "name");
    const std::string* path = StringField(entry, "path");
    if (name == nullptr || path == nullptr || !IsChannelPath(*path)) {
      ++ignoredEntries_;
      TLOG_ERROR(log_, "not subscribing to malformed channel {}", JsonText(entry));
      continue;
    }
    kept.push_back(entry);
  }
  if (subscribed != nullptr) {
    *subscribed = DriverChannels{{"channels", std::move(kept)}};
    if (PendingQuery(channels)) (*subscribed)["pending"] = channels.at("pending");
  }
  return nextSubscription_.fetch_add(1, std::memory_order_relaxed);
}

std::optional<int64_t> CountersTreeDriverStats::ReadChannel(const std::string& canonicalRoot,
                                                            const std::string& rel,
                                                            std::string* why) const {
  if (!IsChannelPath(rel)) {
    *why = "not a path inside the counters tree";
    return std::nullopt;
  }
  const auto resolved = ResolveInside(canonicalRoot, rel);
  if (!resolved) {
    *why = errno == EXDEV ? "the link leads out of the counters tree" : ErrnoText(errno);
    return std::nullopt;
  }
  // Non-blocking, so that a FIFO put in the tree cannot stall the caller.
  const int fd = ::open(resolved->c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
  if (fd < 0) {
    *why = ErrnoText(errno);
    return std::nullopt;
  }
  struct stat info {};
  if (::fstat(fd, &info) != 0 || !S_ISREG(info.st_mode)) {
    ::close(fd);
    *why = "not a regular file";
    return std::nullopt;
  }
  char buffer[kMaxChannelFileBytes + 1];
  size_t filled = 0;
  while (filled < sizeof buffer) {
    const ssize_t got = ::read(fd, buffer + filled, sizeof buffer - filled);
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) {
      const int code = errno;
      ::close(fd);
      *why = ErrnoText(code);
      return std::nullopt;
    }
    if (got == 0) break;
    filled += size_t(got);
  }
  ::close(fd);
  if (filled > kMaxChannelFileBytes) {
    *why = "longer than " + std::to_string(kMaxChannelFileBytes) + " bytes";
    return std::nullopt;
  }
  const std::string_view text(buffer, filled);
  const auto value = ParseCounterText(text);
  if (!value) {
    *why = filled == 0 ? "empty" : "not one signed 64-bit decimal integer";
    return std::nullopt;
  }
  return value;
}

std::optional<DriverSampleSet> CountersTreeDriverStats::CreateSamples(
    DriverSubscription subscription, const DriverChannels& subscribed, OptionalError* error) {
  if (subscription == 0 || subscription >= nextSubscription_.load(std::memory_order_relaxed)) {
    SetError(error, EINVAL, "unknown subscription " + std::to_string(subscription));
    return std::nullopt;
  }
  const Value* list = ArrayOf(subscribed, "channels");
  if (list == nullptr) {
    SetError(error, EINVAL, "subscribed channels are not a channel description");
    return std::nullopt;
  }
  std::optional<std::string> canonical;
  Listing found;
  if (const auto query = list->empty() ? PendingQuery(subscribed) : std::nullopt) {
    // Looked for again on every sample, so a tree or group made after the subscription counts
    // from then on; until then there is nothing to read, which is not an error.
    OptionalError notYet;
    if (!List(found, query->first, query->second, &notYet))
      return DriverSampleSet{{"samples", Value::array()}};
    canonical = found.canonicalRoot;
    list = &found.channels;
  } else {
    canonical = CanonicalPath(root_);
  }
  if (!canonical) {
    const int code = errno;
    SetError(error, code, "counters tree " + root_ + ": " + ErrnoText(code));
    return std::nullopt;
  }
  Value samples = Value::array();
  for (const auto& entry : *list) {
    const std::string* name = StringField(entry, "name");
    const std::string* path = StringField(entry, "path");
    if (name == nullptr || path == nullptr) {
      ++unreadableChannels_;
      TLOG_ERROR(log_, "skipping malformed channel {}", JsonText(entry));
      continue;
    }
    std::string why;
    const auto value = ReadChannel(*canonical, *path, &why);
    if (!value) {
      ++unreadableChannels_;
      TLOG_ERROR(log_, "skipping channel file {}/{}: {}", root_, *path, why);
      continue;
    }
    samples.push_back(Value{{"name", *name}, {"path", *path}, {"value", *value}});
  }
  DriverSampleSet result = MakeDictionary();
  result["samples"] = std::move(samples);
  return result;
}

std::optional<DriverSampleSet> CountersTreeDriverStats::CreateSamplesDelta(
    const DriverSampleSet* earlier, const DriverSampleSet& current, OptionalError* error) {
  const Value* now = ArrayOf(current, "samples");
  if (now == nullptr) {
    SetError(error, EINVAL, "current samples are not a sample set");
    return std::nullopt;
  }
  std::unordered_map<std::string, int64_t> before;
  if (earlier != nullptr) {
    const Value* then = ArrayOf(*earlier, "samples");
    if (then == nullptr) {
      SetError(error, EINVAL, "earlier samples are not a sample set");
      return std::nullopt;
    }
    for (const auto& entry : *then) {
      const auto identity = SampleIdentity(entry);
      const auto value = EntryValue(entry);
      if (identity && value) before[*identity] = *value;
    }
  }
  Value deltas = Value::array();
  for (const auto& entry : *now) {
    const auto identity = SampleIdentity(entry);
    const auto value = EntryValue(entry);
    if (!identity || !value) continue;  // not a sample; IterateSamples would skip it as well
    int64_t base = 0;                   // a channel the earlier set lacks counts from zero
    if (const auto it = before.find(*identity); it != before.end()) base = it->second;
    int64_t difference = 0;
    if (__builtin_sub_overflow(*value, base, &difference)) {
      ++overflowedDeltas_;
      TLOG_ERROR(log_, "skipping channel {}: {} - {} does not fit 64 bits", identity->substr(2),
                 *value, base);
      continue;
    }
    Value delta = entry;
    delta["value"] = difference;
    deltas.push_back(std::move(delta));
  }
  DriverSampleSet result = MakeDictionary();
  result["samples"] = std::move(deltas);
  return result;
}

void CountersTreeDriverStats::IterateSamples(const DriverSampleSet& samples,
                                             const std::function<int(const DriverSample&)>& visit) {
  const Value* list = ArrayOf(samples, "samples");
  if (list == nullptr) return;
  for (const auto& entry : *list) {
    const auto value = EntryValue(entry);
    if (!value) continue;
    DriverSample sample;
    sample.channelName = StringField(entry, "name");
    sample.value = *value;
    if (visit(sample) != 0) return;
  }
}

std::optional<std::string> CountersTreeDriverStats::SampleChannelName(const DriverSample& sample) {
  if (sample.channelName == nullptr) return std::nullopt;
  return *sample.channelName;
}

int64_t CountersTreeDriverStats::SampleIntegerValue(const DriverSample& sample) {
  return sample.value;
}

CountersTreeDriverStats::Drops CountersTreeDriverStats::drops() const {
  return Drops{unreadableChannels_.load(), ignoredEntries_.load(), truncatedQueries_.load(),
               overflowedDeltas_.load()};
}

}  // namespace tavrin
