#include <gtest/gtest.h>

#include "tests/support/TavrindProcess.h"

namespace tavrin {
namespace {

using protocol::RejectCode;
using protocol::Status;
using testing::TavrindProcess;
using testing::TestClient;

std::vector<uint8_t> MsgPack(const Value& value) { return Value::to_msgpack(value); }

// A request array [call, op, args...] with arbitrary argument values.
std::vector<uint8_t> RawRequest(uint64_t call, const Value& op, std::vector<Value> arguments) {
  Value request = Value::array({call, op});
  for (auto& argument : arguments) request.push_back(std::move(argument));
  return MsgPack(request);
}

// One service for every case: each case also checks that a bystander client's session is
// untouched by what the bad client did. Which request gets which code is the codec's unit tests'
// business; here the running service answers them, survives them and keeps the others served.
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
    bystander->Send(90, protocol::ReporterIDValid{4242});
    auto reply = bystander->Read();
    ASSERT_TRUE(reply) << service->Log();
    EXPECT_EQ(reply->call, 90u);
    EXPECT_EQ(reply->value["reporterID"], 4242);
  }

  static TavrindProcess* service;
  static TestClient* bystander;
};

TavrindProcess* BadInputE2eTest::service = nullptr;
TestClient* BadInputE2eTest::bystander = nullptr;

TEST_F(BadInputE2eTest, RequestsThatAreUnderstoodBadlyAreAnsweredAndTheConnectionStays) {
  // A deep value sized to overflow a recursive parser's stack: [6, 1, [[[...1]]]].
  std::vector<uint8_t> deep{0x93, 0x06, 0x01};
  deep.insert(deep.end(), 200000, 0x91);
  deep.push_back(0x01);
  const struct {
    std::vector<uint8_t> body;
    RejectCode code;
  } cases[] = {
      {RawRequest(1, 12, {}), RejectCode::kUnknownOp},
      {RawRequest(2, 1, {}), RejectCode::kWrongArgumentCount},
      {RawRequest(3, 1, {"seven"}), RejectCode::kWrongArgumentType},
      {RawRequest(4, 2, {70000, 7}), RejectCode::kIntegerOutOfRange},
      {RawRequest(5, 6, {Value::binary({1, 2, 3}), 1, 0, nullptr}), RejectCode::kUnsupportedType},
      {deep, RejectCode::kTooDeep},
  };
  TestClient client(service->SocketPath());
  // A nil call runs its operation and answers nothing, so the first reply is the first case's.
  client.SendNoReply(protocol::CreateReportingSession{55});
  for (uint64_t call = 1; call <= std::size(cases); ++call) {
    client.SendBody(cases[call - 1].body);
    auto reply = client.Read();
    ASSERT_TRUE(reply) << "case " << call << "\n" << service->Log();
    EXPECT_EQ(reply->call, call);
    EXPECT_EQ(reply->status, Status::kRejected) << call;
    EXPECT_EQ(reply->value["domain"], "com.quorvex.tavrin.protocol") << call;
    EXPECT_EQ(reply->value["code"], static_cast<int64_t>(cases[call - 1].code)) << call;
  }
  client.Send(100, protocol::ReporterIDValid{55});
  auto reply = client.Read();
  ASSERT_TRUE(reply) << "connection no longer serves after rejected requests";
  EXPECT_EQ(reply->call, 100u);
  EXPECT_EQ(reply->value["reporterID"], 55);
}

TEST_F(BadInputE2eTest, UndecodableFramesAndBadLengthsCloseOnlyThatConnection) {
  std::vector<uint8_t> trailing = RawRequest(2, 10, {});
  trailing.push_back(0x00);  // a byte after the request, inside its frame
  const std::vector<std::vector<uint8_t>> streams = {
      protocol::EncodeFrame(std::vector<uint8_t>{0xc1}),  // a never-used MessagePack byte
      protocol::EncodeFrame(MsgPack(Value::object({{"not", "an array"}}))),
      protocol::EncodeFrame(MsgPack(Value::array({-1, 10}))),  // call must be unsigned or nil
      protocol::EncodeFrame(trailing),
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
