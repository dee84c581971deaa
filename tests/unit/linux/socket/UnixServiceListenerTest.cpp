// The listener over a real socket, with an exported object that records what reaches it: the read
// gate holds requests back without losing or reordering any.

#include "platform/linux/socket/UnixServiceListener.h"

#include <atomic>
#include <filesystem>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "tests/fakes/FakeLogSystem.h"
#include "tests/fakes/GuardedState.h"
#include "tests/support/TestClient.h"

namespace tavrin {
namespace {

// Records the categories of the messages it is sent; answers everything else with defaults.
class RecordingObject final : public RuvoReportingServiceProtocol, GuardedState {
 public:
  void createReportingSession(int64_t, BoolReply reply) override { reply(true); }
  void setServiceType(uint16_t, int64_t, BoolReply reply) override { reply(true); }
  void getServiceNameForReporterID(int64_t, ServiceTypeReply reply) override { reply(0xFFFF); }
  void setConfiguration(const Dictionary&, int64_t, BoolReply reply) override { reply(true); }
  void startReportingSessionForID(int64_t, BoolReply reply) override { reply(true); }
  void sendMessage(Dictionary, uint32_t category, uint16_t,
                   const std::optional<std::vector<int64_t>>&, ErrorReply reply) override {
    std::unique_lock lock(mutex_);
    categories_.push_back(category);
    lock.unlock();
    if (reply) reply(std::nullopt);
  }
  void stopReportingSessionForID(int64_t, BoolReply reply) override { reply(true); }
  void destroyReportingSession(int64_t, BoolReply reply) override { reply(true); }
  void reporterID(int64_t, DictionaryReply valid) override { valid(Dictionary::object()); }
  void getAllReporters(ReportersReply reply) override { reply({}); }
  void killService(BoolReply) override {}

  std::vector<uint32_t> Categories() const { return Locked(categories_); }

 private:
  std::vector<uint32_t> categories_;  // guarded by mutex_
};

// A listener on a real socket whose connections export one RecordingObject, its I/O loop on a
// thread of its own; the read gate is the test's to set before Run().
class UnixServiceListenerTest : public ::testing::Test, public ServiceListenerDelegate {
 protected:
  void Run(std::function<ReadGate()> gate) {
    listener_.Open();
    listener_.SetDelegate(this);
    listener_.SetReadGate(std::move(gate));
    io_ = std::thread([this] { listener_.Resume(); });
  }
  bool shouldAcceptNewConnection(ServiceListener&, const ClientConnectionPtr& connection) override {
    connection->SetExportedObject(object_);
    connection->Resume();
    return true;
  }
  void TearDown() override {
    listener_.Stop();
    if (io_.joinable()) io_.join();
    std::filesystem::remove_all(directory_);
  }

  testing::FakeLogSystem log_;
  const std::string directory_ = testing::MakeTempDirectory("tavrin-listener-");
  UnixServiceListener listener_{UnixListenerOptions{directory_ + "/reporting.sock"}};
  std::shared_ptr<RecordingObject> object_ = std::make_shared<RecordingObject>();
  std::thread io_;
};

TEST_F(UnixServiceListenerTest, ClosedReadGateHoldsRequestsBackAndLosesNoneWhenItOpens) {
  std::atomic<bool> open{false};
  Run([&] { return open.load() ? ReadGate::kOpen : ReadGate::kAllWait; });

  constexpr int kMessages = 2000;
  testing::TestClient client(listener_.SocketPath());
  ASSERT_TRUE(client.connected());
  std::thread sender([&] {
    for (int i = 0; i < kMessages; ++i) {
      client.SendNoReply(
          protocol::SendMessage{Dictionary{{"i", i}}, static_cast<uint32_t>(i), 0, std::nullopt});
    }
  });
  ASSERT_TRUE(testing::WaitUntil([&] { return listener_.ReadGateStalls() > 3; }));
  EXPECT_TRUE(object_->Categories().empty());

  open = true;
  sender.join();
  ASSERT_TRUE(testing::WaitUntil([&] { return object_->Categories().size() == kMessages; }))
      << object_->Categories().size();
  const auto categories = object_->Categories();
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

// While the service is behind, a client that floods waits and one that makes round trips does
// not: with every connection paused, the round trips would stall until the flood drained.
TEST_F(UnixServiceListenerTest, BehindOnlyTheHeavySenderWaitsAndRoundTripsGoOn) {
  std::atomic<bool> behind{false};
  Run([&] { return behind ? ReadGate::kHeavySendersWait : ReadGate::kOpen; });
  testing::TestClient flooder(listener_.SocketPath());
  testing::TestClient asker(listener_.SocketPath());
  const Dictionary payload{{"filler", std::string(512, 'x')}};
  for (int i = 0; i < 200; ++i) flooder.SendNoReply(protocol::SendMessage{payload, 1, 0, {}});
  ASSERT_TRUE(testing::WaitUntil([&] { return object_->Categories().size() == 200; }));
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
  // The flood goes on until the flooder has been made to wait.
  const bool flooderWaited = testing::WaitUntil([&] { return listener_.ReadGateStalls() > 0; });
  stop = true;
  behind = false;  // lets a send blocked on a full socket finish
  flood.join();
  EXPECT_EQ(answered, 50u) << "round trips stalled behind the flood";
  EXPECT_TRUE(flooderWaited);
}

}  // namespace
}  // namespace tavrin
