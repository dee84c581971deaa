#include "platform/linux/orientation/OrientationRegistries.h"

#include <string_view>

#include "platform/linux/orientation/FeedOrientationRegistry.h"
#include "platform/linux/orientation/IioOrientationRegistry.h"
#include "platform/linux/orientation/NoOrientationRegistry.h"

namespace tavrin {

std::unique_ptr<OrientationRegistry> MakeOrientationRegistry(const std::string& source,
                                                             LogHandle log, std::string* error) {
  constexpr std::string_view kFeedPrefix = "feed:";
  if (source == "none") return std::make_unique<NoOrientationRegistry>();
  if (source == "iio") return std::make_unique<IioOrientationRegistry>(std::move(log));
  if (source.starts_with(kFeedPrefix)) {
    std::string path = source.substr(kFeedPrefix.size());
    if (!path.empty()) return std::make_unique<FeedOrientationRegistry>(std::move(path), log);
    if (error) *error = "orientation source \"feed:\" needs a path: feed:PATH";
    return nullptr;
  }
  if (error) {
    *error = "unknown orientation source \"" + source + "\"; expected none, iio or feed:PATH";
  }
  return nullptr;
}

}  // namespace tavrin
