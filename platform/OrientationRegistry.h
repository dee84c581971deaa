#pragma once

#include <functional>
#include <string>

namespace tavrin {

// An orientation as the registry reports it (for example "portrait" or "left-up").
using OrientationValue = std::string;

// Orientation change callbacks, registered under an identifier. Callbacks run on the registry's
// own thread; registering and unregistering may happen from any thread.
class OrientationRegistry {
 public:
  using Callback = std::function<void(const OrientationValue&)>;
  virtual ~OrientationRegistry() = default;
  virtual void RegisterDeviceOrientation(const std::string& id, Callback callback) = 0;
  virtual void RegisterUIOrientation(const std::string& id, Callback callback) = 0;
  // After these return, the callbacks of `id` are not called again.
  virtual void UnregisterDeviceOrientation(const std::string& id) = 0;
  virtual void UnregisterUIOrientation(const std::string& id) = 0;
  virtual std::string OrientationToString(const OrientationValue& value) = 0;
};

}  // namespace tavrin
