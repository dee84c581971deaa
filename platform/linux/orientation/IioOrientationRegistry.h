#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <thread>

#include "platform/LogSystem.h"
#include "platform/OrientationRegistry.h"
#include "platform/linux/orientation/OrientationCallbacks.h"

namespace sdbus {
class IConnection;
class IProxy;
class Message;
class Variant;
}  // namespace sdbus

namespace tavrin {

// OrientationRegistry over iio-sensor-proxy (`--orientation iio`): the device orientation as the
// accelerometer sees it, from the service net.hadess.SensorProxy on the system bus
// (DBUS_SYSTEM_BUS_ADDRESS when set). There is no UI orientation on this road: UI registrations
// are accepted and never called.
//
// The registry's one thread (kOrientationThreadName) owns the bus connection and drives it with
// its own poll loop. It calls ClaimAccelerometer whenever the service gets an owner (at start if
// it is running, and after every restart, followed through NameOwnerChanged), then reads the
// AccelerometerOrientation property and follows it through PropertiesChanged. Each new value
// ("normal", "left-up", "right-up", "bottom-up") goes to every device callback; a value equal to
// the last one delivered is not a change and is not delivered again, and "undefined" (no reading
// yet) is never delivered.
//
// Nothing here stops the service: when the system bus is not reachable it logs once and tries
// again every reconnectInterval; when iio-sensor-proxy is not running it logs once and waits for
// the name to appear; when the bus goes away it reconnects.
//
// Callbacks and unregistration follow OrientationCallbacks. OrientationToString returns the value
// as the proxy names it.
class IioOrientationRegistry final : public OrientationRegistry {
 public:
  struct Options {
    // Between attempts to reach the system bus while it is absent; a bus rarely comes late, so
    // this costs nothing noticeable.
    std::chrono::milliseconds reconnectInterval{2000};
    // Bound on every call to the bus and the proxy: the thread must stay free to stop promptly.
    std::chrono::milliseconds callTimeout{5000};
  };

  explicit IioOrientationRegistry(LogHandle log = nullptr);
  IioOrientationRegistry(Options options, LogHandle log);
  // Wakes the thread and joins it; a callback that is running finishes first. At most one
  // synchronous bus call (bounded by callTimeout) may be in progress.
  ~IioOrientationRegistry() override;
  IioOrientationRegistry(const IioOrientationRegistry&) = delete;
  IioOrientationRegistry& operator=(const IioOrientationRegistry&) = delete;

  void RegisterDeviceOrientation(const std::string& id, Callback callback) override;
  void RegisterUIOrientation(const std::string& id, Callback callback) override;
  void UnregisterDeviceOrientation(const std::string& id) override;
  void UnregisterUIOrientation(const std::string& id) override;
  std::string OrientationToString(const OrientationValue& value) override { return value; }

  struct Status {
    bool connected = false;          // to the system bus
    std::string claimedOwner;        // unique bus name of the proxy claimed from; empty when none
    uint64_t connections = 0;        // successful connections to the bus
    uint64_t failedConnections = 0;  // attempts that did not reach the bus
    uint64_t claims = 0;             // successful ClaimAccelerometer calls
    uint64_t delivered = 0;          // orientation changes handed to the callbacks
    std::string lastOrientation;     // last value delivered
  };
  Status status() const;

 private:
  bool Connect();
  void Disconnect();
  void Run();
  void RunConnected();
  void WaitForWake(std::chrono::milliseconds timeout);
  void OnNameOwnerChanged(sdbus::Message& message);
  void OnPropertiesChanged(sdbus::Message& message);
  void OwnerAppeared(const std::string& owner);
  void Claim(const std::string& owner);
  void ReadOrientation();
  void TakeOrientation(const sdbus::Variant& value);
  template <typename Change>
  void UpdateStatus(Change change);
  // Runs a bus handler; an exception marks the connection lost instead of unwinding sd-bus.
  template <typename Body>
  void Guarded(std::string_view what, Body body);

  const Options options_;
  const LogHandle log_;
  OrientationCallbacks callbacks_;
  int wakeFd_ = -1;
  std::atomic<bool> stopping_{false};

  // Touched only by the thread (and by the destructor after joining it).
  std::unique_ptr<sdbus::IConnection> connection_;
  std::unique_ptr<sdbus::IProxy> sensorProxy_;
  std::unique_ptr<sdbus::IProxy> busProxy_;
  std::unique_ptr<void, std::function<void(void*)>> ownerMatch_;
  std::unique_ptr<void, std::function<void(void*)>> propertiesMatch_;
  std::string owner_;         // current owner of the service name; empty when none
  std::string claimedOwner_;  // the owner whose claim succeeded
  std::string last_;          // last orientation delivered
  bool busAbsentLogged_ = false;
  bool lost_ = false;  // a handler found the connection broken

  mutable std::mutex statusMutex_;
  Status status_;  // guarded by statusMutex_

  std::thread thread_;
};

}  // namespace tavrin
