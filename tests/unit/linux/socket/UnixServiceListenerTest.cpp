// The listener over a real socket, with an exported object that records what reaches it: the read
// gate holds requests back without losing or reordering any.

#include "platform/linux/socket/UnixServiceListener.h"

#include <atomic>
#include <filesystem>
#include <mutex>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "tests/fakes/FakeLogSystem.h"
#include "tests/support/TestClient.h"

namespace tavrin {
namespace {

// Records the categories of the messages it is sent; answers everything else with defaults.
class RecordingObject final : public RuvoReportingServiceProtocol {
 public:
  void createReportingSession(int64_t, BoolReply reply) override { reply(true); }
  void setServiceType(uint16_t, int64_t, BoolReply reply) override { reply(true); }
  void getServiceNameForReporterID(int64_t, ServiceTypeReply reply) override { reply(0xFFFF); }
  void setConfiguration(const Dictionary&, int64_t, BoolReply reply) override { reply(true); }
  void startReportingSessionForID(int64_t, BoolReply reply) override { reply(true); }
  void sendMessage(const Dictionary&, uint32_t category, uint16_t,
                   const std::optional<std::vector<int64_t>>&, ErrorReply reply) override {
    {
      std::lock_guard lock(mutex_);
      categories_.push_back(category);
    }
    if (reply) reply(std::nullopt);
  }
  void stopReportingSessionForID(int64_t, BoolReply reply) override { reply(true); }
  void destroyReportingSession(int64_t, BoolReply reply) override { reply(true); }
  void reporterID(int64_t, DictionaryReply valid) override { valid(Dictionary::object()); }
  void getAllReporters(ReportersReply reply) override { reply({}); }
  void killService(BoolReply) override {}

  std::vector<uint32_t> Categories() const {
    std::lock_guard lock(mutex_);
    return categories_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<uint32_t> categories_;
};

class ExportingDelegate final : public ServiceListenerDelegate {
 public:
  explicit ExportingDelegate(std::shared_ptr<RecordingObject> object)
      : object_(std::move(object)) {}
  bool shouldAcceptNewConnection(ServiceListener&, const ClientConnectionPtr& connection) override {
    connection->SetExportedObject(object_);
    connection->Resume();
    return true;
  }

 private:
  std::shared_ptr<RecordingObject> object_;
};

TEST(UnixServiceListenerTest, ClosedReadGateHoldsRequestsBackAndLosesNoneWhenItOpens) {
  testing::FakeLogSystem log;
  const std::string directory = testing::MakeTempDirectory("tavrin-listener-");
  UnixServiceListener listener(UnixListenerOptions{directory + "/reporting.sock"});
  listener.Open();
  auto object = std::make_shared<RecordingObject>();
  ExportingDelegate delegate(object);
  listener.SetDelegate(&delegate);
  std::atomic<bool> open{false};
  listener.SetReadGate([&] { return open.load() ? ReadGate::kOpen : ReadGate::kAllWait; });
  std::thread io([&] { listener.Resume(); });

  constexpr int kMessages = 2000;
  {
    testing::TestClient client(listener.SocketPath());
    ASSERT_TRUE(client.connected());
    std::thread sender([&] {
      for (int i = 0; i < kMessages; ++i) {
        client.SendNoReply(
            protocol::SendMessage{Dictionary{{"i", i}}, static_cast<uint32_t>(i), 0, std::nullopt});
      }
    });
    ASSERT_TRUE(testing::WaitUntil([&] { return listener.ReadGateStalls() > 3; }));
    EXPECT_TRUE(object->Categories().empty());

    open = true;
    sender.join();
    ASSERT_TRUE(testing::WaitUntil([&] { return object->Categories().size() == kMessages; }))
        << object->Categories().size();
    const auto categories = object->Categories();
    for (int i = 0; i < kMessages; ++i) ASSERT_EQ(categories[i], static_cast<uint32_t>(i));

    // A reply still comes through once the gate is open again after a pause.
    open = false;
    client.Send(7, protocol::GetAllReporters{});
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    open = true;
    auto reply = client.Read();
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->call, 7u);
  }
  listener.Stop();
  io.join();
  std::filesystem::remove_all(directory);
}

// While the service is behind, a client that floods waits and one that makes round trips does
// not: with every connection paused, the round trips would stall until the flood drained.
TEST(UnixServiceListenerTest, BehindOnlyTheHeavySenderWaitsAndRoundTripsGoOn) {
  testing::FakeLogSystem log;
  const std::string directory = testing::MakeTempDirectory("tavrin-listener-");
  UnixServiceListener listener(UnixListenerOptions{directory + "/reporting.sock"});
  listener.Open();
  auto object = std::make_shared<RecordingObject>();
  ExportingDelegate delegate(object);
  listener.SetDelegate(&delegate);
  std::atomic<bool> behind{false};
  listener.SetReadGate([&] { return behind ? ReadGate::kHeavySendersWait : ReadGate::kOpen; });
  std::thread io([&] { listener.Resume(); });
  {
    testing::TestClient flooder(listener.SocketPath());
    testing::TestClient asker(listener.SocketPath());
    const Dictionary payload{{"filler", std::string(512, 'x')}};
    for (int i = 0; i < 200; ++i) flooder.SendNoReply(protocol::SendMessage{payload, 1, 0, {}});
    ASSERT_TRUE(testing::WaitUntil([&] { return object->Categories().size() == 200; }));
    behind = true;
    std::atomic<bool> stop{false};
    std::thread flood([&] {
      while (!stop && flooder.SendNoReply(protocol::SendMessage{payload, 1, 0, {}})) {
      }
    });
    uint64_t answered = 0;
    for (uint64_t call = 1; call <= 50; ++call) {
      asker.Send(call, protocol::GetAllReporters{});
      if (!asker.Read(std::chrono::seconds(5))) break;
      ++answered;
    }
    const uint64_t stalls = listener.ReadGateStalls();
    stop = true;
    behind = false;  // lets a send blocked on a full socket finish
    flood.join();
    EXPECT_EQ(answered, 50u) << "round trips stalled behind the flood";
    EXPECT_GT(stalls, 0u) << "the flooder never waited";
  }
  listener.Stop();
  io.join();
  std::filesystem::remove_all(directory);
}

}  // namespace
}  // namespace tavrin
