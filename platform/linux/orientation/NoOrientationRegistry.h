#pragma once

#include <string>

#include "platform/OrientationRegistry.h"

namespace tavrin {

// `--orientation none`: a machine without an orientation source. Registrations are accepted and
// nothing is ever called, so sessions that track orientation simply record no changes.
class NoOrientationRegistry final : public OrientationRegistry {
 public:
  void RegisterDeviceOrientation(const std::string&, Callback) override {}
  void RegisterUIOrientation(const std::string&, Callback) override {}
  void UnregisterDeviceOrientation(const std::string&) override {}
  void UnregisterUIOrientation(const std::string&) override {}
  std::string OrientationToString(const OrientationValue& value) override { return value; }
};

}  // namespace tavrin
