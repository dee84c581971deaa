#pragma once

#include <cstdint>
#include <string_view>

namespace tavrin {

// Facts about the device ("InternalBuild", "DeviceClassNumber"). An unknown key answers the
// fallback given.
class DeviceInfoQuery {
 public:
  virtual ~DeviceInfoQuery() = default;
  virtual bool QueryBool(std::string_view key, bool fallback) = 0;
  virtual int32_t QueryInt32(std::string_view key, int32_t fallback) = 0;
};

inline constexpr const char* kDeviceInfoInternalBuild = "InternalBuild";
inline constexpr const char* kDeviceInfoDeviceClassNumber = "DeviceClassNumber";

}  // namespace tavrin
