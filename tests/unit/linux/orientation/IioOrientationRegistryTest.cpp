// The iio registry against a private bus daemon and a stand-in for iio-sensor-proxy, both of which
// the tests start, stop and restart.

#include "platform/linux/orientation/IioOrientationRegistry.h"

#include <signal.h>

#include <cstdio>
#include <mutex>

#include <gtest/gtest.h>
#include <sdbus-c++/sdbus-c++.h>

#include "tests/fakes/FakeLogSystem.h"
#include "tests/unit/linux/LinuxTestSupport.h"

namespace tavrin {
namespace {

using namespace std::chrono_literals;
using testing::WaitFor;
using Values = std::vector<std::string>;

constexpr char kInterface[] = "net.hadess.SensorProxy";

// A private bus daemon on a fixed socket, so that it can be stopped and started again at the same
// address.
class BusDaemon {
 public:
  explicit BusDaemon(std::string socket) : socket_(std::move(socket)) {}
  ~BusDaemon() { Stop(); }
  std::string address() const { return "unix:path=" + socket_; }
  // Returns once the daemon listens: it prints its process ID then.
  void Start() {
    output_ = popen(("exec dbus-daemon --session --nofork --print-pid=1 --address=" + address() +
                     " 2>/dev/null")
                        .c_str(),
                    "r");
    ASSERT_TRUE(output_ && fscanf(output_, "%d", &pid_) == 1) << "dbus-daemon did not start";
  }
  void Stop() {
    if (!output_) return;
    kill(pid_, SIGTERM);
    pclose(output_);
    output_ = nullptr;
  }

 private:
  const std::string socket_;
  FILE* output_ = nullptr;
  int pid_ = 0;
};

// A stand-in for iio-sensor-proxy on its own connection, driven by sdbus-c++'s own loop thread.
class FakeSensorProxy {
 public:
  FakeSensorProxy(const std::string& address, std::string orientation, bool broken = false)
      : connection_(sdbus::createSessionBusConnectionWithAddress(address)),
        object_(sdbus::createObject(*connection_, "/net/hadess/SensorProxy")),
        orientation_(std::move(orientation)) {
    object_->registerMethod("ClaimAccelerometer").onInterface(kInterface).implementedAs([] {});
    if (broken) {  // the property holds an integer
      object_->registerProperty("AccelerometerOrientation").onInterface(kInterface).withGetter([] {
        return int32_t(90);
      });
    } else {
      object_->registerProperty("AccelerometerOrientation")
          .onInterface(kInterface)
          .withGetter([this] { return Orientation(); });
    }
    object_->finishRegistration();
    connection_->enterEventLoopAsync();
    connection_->requestName("net.hadess.SensorProxy");
  }
  // Changes the orientation and announces it with PropertiesChanged, as the real proxy does.
  void SetOrientation(const std::string& orientation) {
    std::unique_lock lock(mutex_);
    orientation_ = orientation;
    lock.unlock();
    object_->emitPropertiesChangedSignal(kInterface, {"AccelerometerOrientation"});
  }
  std::string UniqueName() const { return connection_->getUniqueName(); }

 private:
  std::string Orientation() {
    std::lock_guard lock(mutex_);
    return orientation_;
  }
  std::unique_ptr<sdbus::IConnection> connection_;
  std::unique_ptr<sdbus::IObject> object_;
  std::mutex mutex_;
  std::string orientation_;  // guarded by mutex_
};

class IioOrientationRegistryTest : public ::testing::Test {
 protected:
  // Before any registry thread exists: the registry reaches "the system bus" through it.
  void SetUp() override { setenv("DBUS_SYSTEM_BUS_ADDRESS", bus_.address().c_str(), 1); }
  void TearDown() override { unsetenv("DBUS_SYSTEM_BUS_ADDRESS"); }

  // Notes each device orientation, with "!" when it comes on another than the registry's thread.
  void StartRegistry() {
    registry_ = std::make_unique<IioOrientationRegistry>(
        IioOrientationRegistry::Options{.reconnectInterval = 50ms}, nullptr);
    registry_->RegisterDeviceOrientation("dev", [this](const OrientationValue& value) {
      notes_.Add(value + (testing::ThreadName() == kOrientationThreadName ? "" : "!"));
    });
    registry_->RegisterUIOrientation("ui", [](auto&) { ADD_FAILURE() << "no UI orientation"; });
  }
  void StartProxy(const std::string& orientation, bool broken = false) {
    proxy_ = std::make_unique<FakeSensorProxy>(bus_.address(), orientation, broken);
  }
  IioOrientationRegistry::Status Status() const { return registry_->status(); }
  bool WaitSeen(const Values& expected) {
    return WaitFor([&] { return notes_.Get() == expected; });
  }

  testing::FakeLogSystem log_;
  testing::TempDir dir_;
  BusDaemon bus_{dir_ / "bus.socket"};
  testing::Notes notes_;
  std::unique_ptr<IioOrientationRegistry> registry_;
  std::unique_ptr<FakeSensorProxy> proxy_;
};

// No bus, then a bus without the service, then the service; it leaves and comes back; the bus
// restarts. Each absence is logged once, and delivery resumes every time.
TEST_F(IioOrientationRegistryTest, BusAndServiceComingGoingAndComingBackAreFollowed) {
  StartRegistry();
  ASSERT_TRUE(WaitFor([&] { return Status().failedConnections >= 3; }));
  EXPECT_EQ(log_.Count("the system bus is not reachable", LogLevel::kError), 1u);
  bus_.Start();
  ASSERT_TRUE(WaitFor([&] { return log_.Contains("is not on the bus"); }));
  StartProxy("normal");
  ASSERT_TRUE(WaitSeen({"normal"}));
  // A repeat or "undefined" (no reading yet) is no change.
  for (auto orientation : {"normal", "undefined", "left-up"}) proxy_->SetOrientation(orientation);
  ASSERT_TRUE(WaitSeen({"normal", "left-up"}));
  const std::string firstOwner = proxy_->UniqueName();
  proxy_.reset();  // the proxy exits
  ASSERT_TRUE(WaitFor([&] { return Status().claimedOwner.empty(); }));
  EXPECT_TRUE(log_.Contains("left the bus"));
  StartProxy("right-up");
  ASSERT_TRUE(WaitSeen({"normal", "left-up", "right-up"}));
  EXPECT_NE(Status().claimedOwner, firstOwner);
  EXPECT_EQ(Status().claims, 2u);
  EXPECT_EQ(log_.Count("the system bus is not reachable") + log_.Count("is not on the bus"), 2u);

  proxy_.reset();
  bus_.Stop();
  ASSERT_TRUE(WaitFor([&] { return !Status().connected; }));
  bus_.Start();
  StartProxy("bottom-up");
  ASSERT_TRUE(WaitSeen({"normal", "left-up", "right-up", "bottom-up"}));
  EXPECT_EQ(Status().connections, 2u);
  EXPECT_EQ(Status().delivered, 4u);
}

// Running before the registry starts: found at connection, claimed, and its reading refused.
TEST_F(IioOrientationRegistryTest, OrientationThatIsNotAStringIsLoggedAndIgnored) {
  bus_.Start();
  StartProxy("", /*broken=*/true);
  StartRegistry();
  ASSERT_TRUE(WaitFor([&] { return log_.Contains("has type \"i\", not a string; ignored"); }));
  EXPECT_EQ(Status().claims, 1u);
  EXPECT_EQ(Status().delivered, 0u);
}

TEST_F(IioOrientationRegistryTest, DestructionIsPromptWhateverTheBusState) {
  const auto start = std::chrono::steady_clock::now();
  IioOrientationRegistry::Options slow{.reconnectInterval = 60s};
  { IioOrientationRegistry absentBus(slow, nullptr); }  // waits between attempts
  bus_.Start();
  { IioOrientationRegistry connected(slow, nullptr); }
  EXPECT_LT(std::chrono::steady_clock::now() - start, 10s);
}

}  // namespace
}  // namespace tavrin
