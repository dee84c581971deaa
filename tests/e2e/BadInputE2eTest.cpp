#include <gtest/gtest.h>

#include "tests/support/TavrindProcess.h"

namespace tavrin {
namespace {

using protocol::RejectCode;
using testing::TavrindProcess;
using testing::TestClient;

// One service for every case: each case also checks that a bystander client's session is
// untouched by what the bad client did. Which request gets which code, and which frame is
// undecodable, is the codec's unit tests' business; here the running service answers one of each
// way (a rejection, a closed connection), survives them and keeps the others served.
class BadInputE2eTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    service = new TavrindProcess();
    ASSERT_TRUE(service->Start()) << service->Log();
    bystander = new TestClient(service->SocketPath());
    bystander->Send(1, protocol::CreateReportingSession{4242});
    bystander->Send(2, protocol::StartReportingSessionForID{4242});
    ASSERT_TRUE(bystander->Read());  // the create; the start reply is held
  }
  static void TearDownTestSuite() {
    delete bystander;
    delete service;
  }

  void TearDown() override {
    // The bystander's session is still there, started, and its connection still serves.
    const auto reply = bystander->Call(protocol::ReporterIDValid{4242});
    EXPECT_EQ(reply.value_or(protocol::Reply{}).value.value("reporterID", 0), 4242)
        << service->Log();
  }

  static TavrindProcess* service;
  static TestClient* bystander;
};

TavrindProcess* BadInputE2eTest::service = nullptr;
TestClient* BadInputE2eTest::bystander = nullptr;

TEST_F(BadInputE2eTest, RequestsThatAreUnderstoodBadlyAreAnsweredAndTheConnectionStays) {
  // A deep value sized to overflow a recursive parser's stack: [1, 1, [[[...1]]]].
  std::vector<uint8_t> deep{0x93, 0x01, 0x01};
  deep.insert(deep.end(), 200000, 0x91);
  deep.push_back(0x01);
  TestClient client(service->SocketPath());
  // A nil call runs its operation and answers nothing, so the first reply is the rejection's.
  client.SendNoReply(protocol::CreateReportingSession{55});
  client.SendBody(deep);
  EXPECT_EQ(testing::Describe(client.Read()),
            "1 2 com.quorvex.tavrin.protocol " + std::to_string(int(RejectCode::kTooDeep)))
      << service->Log();
  const auto reply = client.Call(protocol::ReporterIDValid{55});
  EXPECT_EQ(reply.value_or(protocol::Reply{}).value.value("reporterID", 0), 55)
      << "connection no longer serves after a rejected request";
}

TEST_F(BadInputE2eTest, UndecodableFramesAndBadLengthsCloseOnlyThatConnection) {
  const std::vector<std::vector<uint8_t>> streams = {
      protocol::EncodeFrame(std::vector<uint8_t>{0xc1}),  // a never-used MessagePack byte
      {0, 0, 0, 0},
      {0x00, 0x20, 0x00, 0x00},  // 2 MiB, over the 1 MiB limit
  };
  for (const auto& bytes : streams) {
    TestClient client(service->SocketPath());
    client.SendBytes(bytes);
    EXPECT_TRUE(client.WaitForClose()) << "stream of " << bytes.size() << " bytes";
  }
}

TEST_F(BadInputE2eTest, FrameCutOffByADisconnectInterruptsTheConnection) {
  const size_t before = service->LogCount("InterruptionHandler: connection exited");
  const size_t invalidations = service->LogCount("InvalidationHandler: connection exited");
  {
    TestClient client(service->SocketPath());
    client.Send(1, protocol::CreateReportingSession{31});
    ASSERT_TRUE(client.Read());
    client.SendBytes({0x00, 0x00, 0x00, 0x10, 0x93});  // 16 bytes announced, 1 sent
  }
  EXPECT_TRUE(service->WaitForLog("InterruptionHandler: connection exited", before + 1))
      << service->Log();
  // A clean goodbye between frames is an invalidation only.
  {
    TestClient client(service->SocketPath());
    client.Send(1, protocol::GetAllReporters{});
    ASSERT_TRUE(client.Read());
  }
  EXPECT_TRUE(service->WaitForLog("InvalidationHandler: connection exited", invalidations + 2));
  EXPECT_EQ(service->LogCount("InterruptionHandler: connection exited"), before + 1);
}

}  // namespace
}  // namespace tavrin
