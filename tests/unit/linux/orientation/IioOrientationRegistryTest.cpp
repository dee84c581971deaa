#include "platform/linux/orientation/IioOrientationRegistry.h"

#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

#include <sdbus-c++/sdbus-c++.h>

#include "tests/fakes/FakeLogSystem.h"

extern char** environ;

namespace tavrin {
namespace {

using namespace std::chrono_literals;
using testing::FakeLogSystem;
namespace fs = std::filesystem;

// Generous: other builds share the two cores.
constexpr auto kWaitLimit = 10s;

bool WaitFor(const std::function<bool()>& condition) {
  const auto deadline = std::chrono::steady_clock::now() + kWaitLimit;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(2ms);
  }
  return true;
}

constexpr char kService[] = "net.hadess.SensorProxy";
constexpr char kObjectPath[] = "/net/hadess/SensorProxy";
constexpr char kInterface[] = "net.hadess.SensorProxy";

// A private bus daemon listening on a fixed socket, so that it can be stopped and started again
// at the same address.
class BusDaemon {
 public:
  explicit BusDaemon(const fs::path& dir)
      : socket_((dir / "system_bus_socket").string()),
        config_((dir / "bus.conf").string()),
        log_((dir / "bus.log").string()) {
    std::ofstream(config_) << R"(<!DOCTYPE busconfig PUBLIC
 "-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN"
 "http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd">
<busconfig>
  <type>session</type>
  <listen>unix:path=)" << socket_
                           << R"(</listen>
  <auth>EXTERNAL</auth>
  <policy context="default">
    <allow user="*"/>
    <allow own="*"/>
    <allow send_type="method_call"/>
    <allow send_type="signal"/>
    <allow send_type="method_return"/>
    <allow send_type="error"/>
    <allow receive_type="method_call"/>
    <allow receive_type="signal"/>
    <allow receive_type="method_return"/>
    <allow receive_type="error"/>
  </policy>
</busconfig>
)";
  }
  ~BusDaemon() { Stop(); }

  std::string address() const { return "unix:path=" + socket_; }

  // Returns once the daemon listens (it prints its address then).
  void Start() {
    ASSERT_LT(pid_, 0);
    int ready[2];
    ASSERT_EQ(pipe2(ready, O_CLOEXEC), 0);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, ready[1], 3);  // dup2 clears close-on-exec
    // Kept out of the test output (as root it complains about the descriptor limit).
    posix_spawn_file_actions_addopen(&actions, 2, log_.c_str(), O_WRONLY | O_CREAT | O_APPEND,
                                     0644);
    const std::string configArg = "--config-file=" + config_;
    const char* argv[] = {"dbus-daemon", configArg.c_str(), "--nofork", "--print-address=3",
                          nullptr};
    const int spawned =
        posix_spawnp(&pid_, "dbus-daemon", &actions, nullptr, const_cast<char**>(argv), environ);
    posix_spawn_file_actions_destroy(&actions);
    close(ready[1]);
    ASSERT_EQ(spawned, 0) << std::strerror(spawned);
    std::string line;
    char c;
    while (read(ready[0], &c, 1) == 1 && c != '\n') line += c;
    close(ready[0]);
    ASSERT_FALSE(line.empty()) << "dbus-daemon did not start";
  }

  void Stop() {
    if (pid_ < 0) return;
    kill(pid_, SIGTERM);
    int status;
    waitpid(pid_, &status, 0);
    pid_ = -1;
    unlink(socket_.c_str());
  }

 private:
  const std::string socket_;
  const std::string config_;
  const std::string log_;
  pid_t pid_ = -1;
};

// A stand-in for iio-sensor-proxy on its own connection, driven by sdbus-c++'s own loop thread.
class FakeSensorProxy {
 public:
  struct Options {
    std::string orientation = "normal";
    bool takeName = true;
    bool orientationIsNotAString = false;  // a broken proxy: the property holds an integer
  };

  FakeSensorProxy(const std::string& address, Options options)
      : connection_(sdbus::createSessionBusConnectionWithAddress(address)),
        orientation_(options.orientation) {
    object_ = sdbus::createObject(*connection_, kObjectPath);
    object_->registerMethod("ClaimAccelerometer").onInterface(kInterface).implementedAs([this] {
      ++claims_;
    });
    object_->registerMethod("ReleaseAccelerometer").onInterface(kInterface).implementedAs([this] {
      ++releases_;
    });
    if (options.orientationIsNotAString) {
      object_->registerProperty("AccelerometerOrientation").onInterface(kInterface).withGetter([] {
        return int32_t(90);
      });
    } else {
      object_->registerProperty("AccelerometerOrientation")
          .onInterface(kInterface)
          .withGetter([this] { return Orientation(); });
    }
    object_->registerProperty("HasAccelerometer").onInterface(kInterface).withGetter([] {
      return true;
    });
    object_->finishRegistration();
    connection_->enterEventLoopAsync();
    if (options.takeName) TakeName();
  }

  void TakeName() { connection_->requestName(kService); }
  void DropName() { connection_->releaseName(kService); }
  std::string UniqueName() const { return connection_->getUniqueName(); }

  // Changes the orientation; `announce` sends PropertiesChanged as the real proxy does.
  void SetOrientation(const std::string& orientation, bool announce = true) {
    {
      std::lock_guard lock(mutex_);
      orientation_ = orientation;
    }
    if (announce) object_->emitPropertiesChangedSignal(kInterface, {"AccelerometerOrientation"});
  }
  std::string Orientation() const {
    std::lock_guard lock(mutex_);
    return orientation_;
  }
  int claims() const { return claims_.load(); }

 private:
  std::unique_ptr<sdbus::IConnection> connection_;
  std::unique_ptr<sdbus::IObject> object_;
  mutable std::mutex mutex_;
  std::string orientation_;
  std::atomic<int> claims_{0};
  std::atomic<int> releases_{0};
};

class Recorder {
 public:
  OrientationRegistry::Callback Callback() {
    return [this](const OrientationValue& value) {
      char name[16] = {};
      pthread_getname_np(pthread_self(), name, sizeof name);
      std::lock_guard lock(mutex_);
      values_.push_back(value);
      threads_.push_back(name);
    };
  }
  std::vector<std::string> Values() const {
    std::lock_guard lock(mutex_);
    return values_;
  }
  std::vector<std::string> Threads() const {
    std::lock_guard lock(mutex_);
    return threads_;
  }
  bool WaitValues(const std::vector<std::string>& expected) const {
    return WaitFor([&] { return Values() == expected; });
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> values_;
  std::vector<std::string> threads_;
};

class IioOrientationRegistryTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "tavrin-iio-XXXXXX").string();
    ASSERT_NE(mkdtemp(pattern.data()), nullptr);
    dir_ = pattern;
    bus_ = std::make_unique<BusDaemon>(dir_);
    // Before any registry thread exists: the registry reaches "the system bus" through it.
    setenv("DBUS_SYSTEM_BUS_ADDRESS", bus_->address().c_str(), 1);
  }
  void TearDown() override {
    registry_.reset();
    proxy_.reset();
    bus_.reset();
    unsetenv("DBUS_SYSTEM_BUS_ADDRESS");
    fs::remove_all(dir_);
  }

  IioOrientationRegistry& StartRegistry() {
    IioOrientationRegistry::Options options;
    options.reconnectInterval = 50ms;
    registry_ = std::make_unique<IioOrientationRegistry>(options, nullptr);
    registry_->RegisterDeviceOrientation("dev", device_.Callback());
    return *registry_;
  }
  void StartProxy(FakeSensorProxy::Options options = {}) {
    proxy_ = std::make_unique<FakeSensorProxy>(bus_->address(), options);
  }
  IioOrientationRegistry::Status Status() const { return registry_->status(); }
  bool WaitClaims(uint64_t n) {
    return WaitFor([&] { return Status().claims >= n; });
  }

  FakeLogSystem log_;
  fs::path dir_;
  std::unique_ptr<BusDaemon> bus_;
  std::unique_ptr<FakeSensorProxy> proxy_;
  Recorder device_;
  std::unique_ptr<IioOrientationRegistry> registry_;
};

TEST_F(IioOrientationRegistryTest, ServiceAppearingLaterIsClaimedAndItsOrientationDelivered) {
  bus_->Start();
  auto& registry = StartRegistry();
  ASSERT_TRUE(WaitFor([&] { return Status().connected; }));
  ASSERT_TRUE(WaitFor([&] { return log_.Contains("is not on the bus"); }));
  EXPECT_EQ(Status().claims, 0u);

  StartProxy({.orientation = "left-up"});
  ASSERT_TRUE(device_.WaitValues({"left-up"}));
  EXPECT_EQ(proxy_->claims(), 1);
  EXPECT_EQ(Status().claimedOwner, proxy_->UniqueName());
  EXPECT_EQ(device_.Threads(), (std::vector<std::string>{kOrientationThreadName}));
  EXPECT_EQ(registry.OrientationToString("left-up"), "left-up");
  EXPECT_EQ(log_.Count("is not on the bus"), 1u);
}

TEST_F(IioOrientationRegistryTest, ServiceRunningAtStartIsClaimedAndChangesFollow) {
  bus_->Start();
  StartProxy({.orientation = "normal"});
  StartRegistry();
  // The first value may come before the callback is in place; the status has it either way.
  ASSERT_TRUE(WaitFor([&] { return Status().lastOrientation == "normal"; }));
  EXPECT_EQ(proxy_->claims(), 1);
  proxy_->SetOrientation("right-up");
  ASSERT_TRUE(
      WaitFor([&] { return !device_.Values().empty() && device_.Values().back() == "right-up"; }));
  EXPECT_EQ(log_.Count("is not on the bus"), 0u);
}

TEST_F(IioOrientationRegistryTest, RestartedServiceIsClaimedAgain) {
  bus_->Start();
  StartRegistry();
  ASSERT_TRUE(WaitFor([&] { return Status().connected; }));
  StartProxy({.orientation = "normal"});
  ASSERT_TRUE(device_.WaitValues({"normal"}));

  const std::string firstOwner = proxy_->UniqueName();
  proxy_.reset();  // the proxy exits
  ASSERT_TRUE(WaitFor([&] { return Status().claimedOwner.empty(); }));
  EXPECT_TRUE(log_.Contains("left the bus"));

  StartProxy({.orientation = "left-up"});
  ASSERT_NE(proxy_->UniqueName(), firstOwner);
  ASSERT_TRUE(device_.WaitValues({"normal", "left-up"}));
  EXPECT_EQ(proxy_->claims(), 1);
  EXPECT_EQ(Status().claims, 2u);
  EXPECT_EQ(Status().claimedOwner, proxy_->UniqueName());
  proxy_->SetOrientation("right-up");
  ASSERT_TRUE(device_.WaitValues({"normal", "left-up", "right-up"}));
}

TEST_F(IioOrientationRegistryTest, NoBusAtStartIsLoggedOnceAndTheBusIsJoinedWhenItComes) {
  auto& registry = StartRegistry();
  ASSERT_TRUE(WaitFor([&] { return registry.status().failedConnections >= 3; }));
  EXPECT_FALSE(registry.status().connected);
  EXPECT_EQ(log_.Count("the system bus is not reachable", LogLevel::kError), 1u);

  bus_->Start();
  StartProxy({.orientation = "right-up"});
  ASSERT_TRUE(device_.WaitValues({"right-up"}));
  EXPECT_EQ(proxy_->claims(), 1);
  EXPECT_EQ(log_.Count("the system bus is not reachable"), 1u);
}

TEST_F(IioOrientationRegistryTest, BusRestartIsSurvivedAndDeliveryResumes) {
  bus_->Start();
  StartRegistry();
  StartProxy({.orientation = "normal"});
  ASSERT_TRUE(device_.WaitValues({"normal"}));

  proxy_.reset();
  bus_->Stop();
  ASSERT_TRUE(WaitFor([&] { return !Status().connected; }));
  bus_->Start();
  StartProxy({.orientation = "left-up"});
  ASSERT_TRUE(device_.WaitValues({"normal", "left-up"}));
  EXPECT_EQ(Status().connections, 2u);
  EXPECT_EQ(proxy_->claims(), 1);
}

TEST_F(IioOrientationRegistryTest, DestructionIsPromptWhateverTheBusState) {
  // No bus at all: the thread waits between attempts and must still stop at once.
  IioOrientationRegistry::Options slow;
  slow.reconnectInterval = 60s;
  const auto start = std::chrono::steady_clock::now();
  { IioOrientationRegistry registry(slow, nullptr); }
  bus_->Start();
  { IioOrientationRegistry registry(slow, nullptr); }
  EXPECT_LT(std::chrono::steady_clock::now() - start, kWaitLimit);
}

}  // namespace
}  // namespace tavrin
