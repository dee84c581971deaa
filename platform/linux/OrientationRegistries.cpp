#include "platform/linux/OrientationRegistries.h"

#include <string_view>

#include "platform/linux/FeedOrientationRegistry.h"
#include "platform/linux/IioOrientationRegistry.h"
#include "platform/linux/NoOrientationRegistry.h"

namespace tavrin {

std::unique_ptr<OrientationRegistry> MakeOrientationRegistry(const std::string& spec, LogHandle log,
                                                             std::string* error) {
  constexpr std::string_view kFeedPrefix = "feed:";
  if (spec == "none") return std::make_unique<NoOrientationRegistry>();
  if (spec == "iio") return std::make_unique<IioOrientationRegistry>(std::move(log));
  if (spec.starts_with(kFeedPrefix)) {
    std::string path = spec.substr(kFeedPrefix.size());
    if (!path.empty()) return std::make_unique<FeedOrientationRegistry>(std::move(path), log);
    if (error) *error = "orientation source \"feed:\" needs a path: feed:PATH";
    return nullptr;
  }
  if (error) {
    *error = "unknown orientation source \"" + spec + "\"; expected none, iio or feed:PATH";
  }
  return nullptr;
}

}  // namespace tavrin
