#include "platform/linux/orientation/IioOrientationRegistry.h"

#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <map>
#include <vector>

#include <sdbus-c++/sdbus-c++.h>

namespace tavrin {
namespace {

constexpr char kService[] = "net.hadess.SensorProxy";
constexpr char kObjectPath[] = "/net/hadess/SensorProxy";
constexpr char kInterface[] = "net.hadess.SensorProxy";
constexpr char kOrientationProperty[] = "AccelerometerOrientation";
constexpr char kPropertiesInterface[] = "org.freedesktop.DBus.Properties";
constexpr char kUndefined[] = "undefined";

constexpr char kBusService[] = "org.freedesktop.DBus";
constexpr char kBusPath[] = "/org/freedesktop/DBus";
constexpr char kBusInterface[] = "org.freedesktop.DBus";

const std::string kOwnerMatch = fmt::format(
    "type='signal',sender='{}',path='{}',interface='{}',member='NameOwnerChanged',arg0='{}'",
    kBusService, kBusPath, kBusInterface, kService);
const std::string kPropertiesMatch = fmt::format(
    "type='signal',sender='{}',path='{}',interface='{}',member='PropertiesChanged',arg0='{}'",
    kService, kObjectPath, kPropertiesInterface, kInterface);

}  // namespace

IioOrientationRegistry::IioOrientationRegistry(LogHandle log)
    : IioOrientationRegistry(Options{}, std::move(log)) {}

IioOrientationRegistry::IioOrientationRegistry(Options options, LogHandle log)
    : options_(options), log_(std::move(log)), callbacks_(log_) {
  wakeFd_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (wakeFd_ < 0) {
    TLOG_ERROR(log_, "iio orientation: eventfd failed: {}; no orientation will be delivered",
               std::strerror(errno));
    return;
  }
  thread_ = std::thread([this] { Run(); });
}

IioOrientationRegistry::~IioOrientationRegistry() {
  if (thread_.joinable()) {
    stopping_ = true;
    const uint64_t one = 1;
    if (write(wakeFd_, &one, sizeof one) < 0) {
      // An eventfd write fails only when the counter would overflow, and then it is set already.
    }
    thread_.join();
  }
  Disconnect();
  if (wakeFd_ >= 0) close(wakeFd_);
}

void IioOrientationRegistry::RegisterDeviceOrientation(const std::string& id, Callback callback) {
  callbacks_.Register(OrientationKind::kDevice, id, std::move(callback));
}

void IioOrientationRegistry::RegisterUIOrientation(const std::string& id, Callback callback) {
  // Kept so that registering and unregistering stay symmetrical; never delivered.
  callbacks_.Register(OrientationKind::kUI, id, std::move(callback));
}

void IioOrientationRegistry::UnregisterDeviceOrientation(const std::string& id) {
  callbacks_.Unregister(OrientationKind::kDevice, id);
}

void IioOrientationRegistry::UnregisterUIOrientation(const std::string& id) {
  callbacks_.Unregister(OrientationKind::kUI, id);
}

IioOrientationRegistry::Status IioOrientationRegistry::status() const {
  std::lock_guard lock(statusMutex_);
  return status_;
}

template <typename Change>
void IioOrientationRegistry::UpdateStatus(Change change) {
  std::lock_guard lock(statusMutex_);
  change(status_);
}

void IioOrientationRegistry::Run() {
  pthread_setname_np(pthread_self(), kOrientationThreadName);
  while (!stopping_) {
    if (!connection_ && !Connect()) {
      WaitForWake(options_.reconnectInterval);
      continue;
    }
    try {
      RunConnected();
    } catch (const sdbus::Error& e) {
      TLOG_ERROR(log_, "iio orientation: lost the system bus ({}: {}); reconnecting", e.getName(),
                 e.getMessage());
      Disconnect();
    }
  }
}

// One round of the loop: everything sd-bus holds already, then wait for the socket, the wake
// descriptor or sd-bus's own deadline (a call's time-out).
void IioOrientationRegistry::RunConnected() {
  // Synchronous calls (connecting, adding matches) read and queue whatever arrives meanwhile; the
  // socket will not wake poll for those, so the queue is emptied before every wait.
  while (connection_->processPendingRequest()) {
    if (stopping_) return;
  }
  if (lost_) {
    Disconnect();
    return;
  }
  const auto pollData = connection_->getEventLoopPollData();
  pollfd fds[2] = {{pollData.fd, pollData.events, 0}, {wakeFd_, POLLIN, 0}};
  if (poll(fds, 2, pollData.getPollTimeout()) < 0) {
    if (errno == EINTR) return;
    TLOG_ERROR(log_, "iio orientation: poll failed: {}", std::strerror(errno));
    Disconnect();
    return;
  }
  if (fds[1].revents != 0) {
    uint64_t count;
    if (read(wakeFd_, &count, sizeof count) < 0) {
      // Nothing to do: the descriptor is only a doorbell.
    }
    return;
  }
  if (fds[0].revents & (POLLHUP | POLLERR)) {
    // Let sd-bus take what is left, then start over on a new connection.
    while (connection_->processPendingRequest()) {
    }
    TLOG_ERROR(log_, "iio orientation: the system bus hung up; reconnecting");
    Disconnect();
  }
}

void IioOrientationRegistry::WaitForWake(std::chrono::milliseconds timeout) {
  pollfd fd{wakeFd_, POLLIN, 0};
  if (poll(&fd, 1, int(timeout.count())) > 0) {
    uint64_t count;
    if (read(wakeFd_, &count, sizeof count) < 0) {
      // Only a doorbell.
    }
  }
}

bool IioOrientationRegistry::Connect() {
  TLOG_OPERATION("Connect");
  try {
    connection_ = sdbus::createSystemBusConnection();
    connection_->setMethodCallTimeout(options_.callTimeout);
    sensorProxy_ = sdbus::createProxy(*connection_, kService, kObjectPath);
    busProxy_ = sdbus::createProxy(*connection_, kBusService, kBusPath);
    ownerMatch_ = connection_->addMatch(kOwnerMatch, [this](sdbus::Message& message) {
      Guarded("NameOwnerChanged", [&] { OnNameOwnerChanged(message); });
    });
    propertiesMatch_ = connection_->addMatch(kPropertiesMatch, [this](sdbus::Message& message) {
      Guarded("PropertiesChanged", [&] { OnPropertiesChanged(message); });
    });
    // Whoever owns the name now; later owners arrive through NameOwnerChanged, which is already
    // matched, so none slips between the two.
    busProxy_->callMethodAsync("GetNameOwner")
        .onInterface(kBusInterface)
        .withTimeout(options_.callTimeout)
        .withArguments(std::string(kService))
        .uponReplyInvoke([this](const sdbus::Error* error, std::string owner) {
          Guarded("GetNameOwner", [&] {
            if (error == nullptr) {
              OwnerAppeared(owner);
            } else if (owner_.empty()) {
              TLOG_DEFAULT(log_, "iio orientation: {} is not on the bus ({}); waiting for it",
                           kService, error->getName());
            }
          });
        });
  } catch (const sdbus::Error& e) {
    if (!busAbsentLogged_) {
      TLOG_ERROR(log_,
                 "iio orientation: the system bus is not reachable ({}: {}); trying again every "
                 "{} ms",
                 e.getName(), e.getMessage(), options_.reconnectInterval.count());
      busAbsentLogged_ = true;
    }
    Disconnect();
    UpdateStatus([](Status& s) { ++s.failedConnections; });
    return false;
  }
  busAbsentLogged_ = false;
  UpdateStatus([](Status& s) {
    s.connected = true;
    ++s.connections;
  });
  TLOG_INFO(log_, "iio orientation: connected to the system bus as {}",
            connection_->getUniqueName());
  return true;
}

void IioOrientationRegistry::Disconnect() {
  // Matches and proxies refer to the connection, so they go first.
  ownerMatch_.reset();
  propertiesMatch_.reset();
  sensorProxy_.reset();
  busProxy_.reset();
  connection_.reset();
  lost_ = false;
  owner_.clear();
  claimedOwner_.clear();
  UpdateStatus([](Status& s) {
    s.connected = false;
    s.claimedOwner.clear();
  });
}

template <typename Body>
void IioOrientationRegistry::Guarded(std::string_view what, Body body) {
  // Handlers run inside sd-bus's dispatch, which must not be unwound by an exception. A failure
  // to send means the connection is broken: the loop starts over on a new one.
  try {
    body();
  } catch (const sdbus::Error& e) {
    TLOG_ERROR(log_, "iio orientation: handling {} failed ({}: {}); reconnecting", what,
               e.getName(), e.getMessage());
    lost_ = true;
  } catch (const std::exception& e) {
    TLOG_ERROR(log_, "iio orientation: handling {} failed ({}); reconnecting", what, e.what());
    lost_ = true;
  }
}

void IioOrientationRegistry::OnNameOwnerChanged(sdbus::Message& message) {
  std::string name, oldOwner, newOwner;
  try {
    message >> name >> oldOwner >> newOwner;
  } catch (const sdbus::Error& e) {
    TLOG_ERROR(log_, "iio orientation: unreadable NameOwnerChanged: {}", e.getMessage());
    return;
  }
  if (name != kService) return;
  if (newOwner.empty()) {
    TLOG_DEFAULT(log_, "iio orientation: {} ({}) left the bus; waiting for it to come back",
                 kService, oldOwner);
    owner_.clear();
    claimedOwner_.clear();
    UpdateStatus([](Status& s) { s.claimedOwner.clear(); });
    return;
  }
  OwnerAppeared(newOwner);
}

void IioOrientationRegistry::OwnerAppeared(const std::string& owner) {
  // GetNameOwner and NameOwnerChanged may both report the same owner.
  if (owner == owner_) return;
  owner_ = owner;
  TLOG_INFO(log_, "iio orientation: {} is {}; claiming the accelerometer", kService, owner);
  Claim(owner);
}

void IioOrientationRegistry::Claim(const std::string& owner) {
  TLOG_OPERATION("Claim");
  sensorProxy_->callMethodAsync("ClaimAccelerometer")
      .onInterface(kInterface)
      .withTimeout(options_.callTimeout)
      .uponReplyInvoke([this, owner](const sdbus::Error* error) {
        Guarded("ClaimAccelerometer", [&] {
          if (owner != owner_) return;  // that owner has gone meanwhile
          if (error != nullptr) {
            TLOG_ERROR(log_, "iio orientation: ClaimAccelerometer on {} failed ({}: {})", owner,
                       error->getName(), error->getMessage());
            return;
          }
          claimedOwner_ = owner;
          UpdateStatus([&](Status& s) {
            s.claimedOwner = owner;
            ++s.claims;
          });
          ReadOrientation();
        });
      });
}

void IioOrientationRegistry::ReadOrientation() {
  TLOG_OPERATION("ReadOrientation");
  sensorProxy_->callMethodAsync("Get")
      .onInterface(kPropertiesInterface)
      .withTimeout(options_.callTimeout)
      .withArguments(std::string(kInterface), std::string(kOrientationProperty))
      .uponReplyInvoke([this](const sdbus::Error* error, sdbus::Variant value) {
        Guarded("Get", [&] {
          if (error != nullptr) {
            TLOG_ERROR(log_, "iio orientation: reading {} failed ({}: {})", kOrientationProperty,
                       error->getName(), error->getMessage());
            return;
          }
          TakeOrientation(value);
        });
      });
}

void IioOrientationRegistry::OnPropertiesChanged(sdbus::Message& message) {
  std::string interface;
  std::map<std::string, sdbus::Variant> changed;
  std::vector<std::string> invalidated;
  try {
    message >> interface >> changed >> invalidated;
  } catch (const sdbus::Error& e) {
    TLOG_ERROR(log_, "iio orientation: unreadable PropertiesChanged: {}", e.getMessage());
    return;
  }
  // Changes seen before the claim went through are followed by the read after it.
  if (interface != kInterface || claimedOwner_.empty()) return;
  if (const auto it = changed.find(kOrientationProperty); it != changed.end()) {
    TakeOrientation(it->second);
    return;
  }
  for (const auto& name : invalidated) {
    if (name == kOrientationProperty) ReadOrientation();
  }
}

void IioOrientationRegistry::TakeOrientation(const sdbus::Variant& value) {
  if (!value.containsValueOfType<std::string>()) {
    TLOG_ERROR(log_, "iio orientation: {} has type \"{}\", not a string; ignored",
               kOrientationProperty, value.peekValueType());
    return;
  }
  const auto orientation = value.get<std::string>();
  if (orientation.empty() || orientation == kUndefined || orientation == last_) return;
  last_ = orientation;
  UpdateStatus([&](Status& s) {
    ++s.delivered;
    s.lastOrientation = orientation;
  });
  TLOG_DEBUG(log_, "iio orientation: device orientation is now {}", orientation);
  callbacks_.Deliver(OrientationKind::kDevice, orientation);
}

}  // namespace tavrin
