#include <gtest/gtest.h>

#include <csignal>

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
// untouched by what the bad client did.
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

  // Expects a status 2 reply for `call` with `code`, and that the connection still serves.
  static void ExpectRejected(TestClient& client, uint64_t call, RejectCode code) {
    auto reply = client.Read();
    ASSERT_TRUE(reply) << service->Log();
    EXPECT_EQ(reply->call, call);
    EXPECT_EQ(reply->status, Status::kRejected);
    EXPECT_EQ(reply->value["domain"], "com.quorvex.tavrin.protocol");
    EXPECT_EQ(reply->value["code"], static_cast<int64_t>(code));
    EXPECT_TRUE(reply->value["reason"].is_string());
    client.Send(call + 1000, protocol::GetAllReporters{});
    auto next = client.Read();
    ASSERT_TRUE(next) << "connection no longer serves after a rejected request";
    EXPECT_EQ(next->call, call + 1000);
  }

  static TavrindProcess* service;
  static TestClient* bystander;
};

TavrindProcess* BadInputE2eTest::service = nullptr;
TestClient* BadInputE2eTest::bystander = nullptr;

TEST_F(BadInputE2eTest, RequestsThatAreUnderstoodBadlyAreAnsweredAndTheConnectionStays) {
  TestClient client(service->SocketPath());
  client.SendBody(RawRequest(1, 12, {}));
  ExpectRejected(client, 1, RejectCode::kUnknownOp);
  client.SendBody(RawRequest(2, 1, {}));
  ExpectRejected(client, 2, RejectCode::kWrongArgumentCount);
  client.SendBody(RawRequest(3, 1, {"seven"}));
  ExpectRejected(client, 3, RejectCode::kWrongArgumentType);
  client.SendBody(RawRequest(4, 2, {70000, 7}));
  ExpectRejected(client, 4, RejectCode::kIntegerOutOfRange);
  client.SendBody(RawRequest(5, 1, {uint64_t{1} << 63}));
  ExpectRejected(client, 5, RejectCode::kIntegerOutOfRange);
  client.SendBody(RawRequest(6, 6, {Value::binary({1, 2, 3}), 1, 0, nullptr}));
  ExpectRejected(client, 6, RejectCode::kUnsupportedType);
  client.SendBody(RawRequest(7, 4, {Value::array({1}), 7}));
  ExpectRejected(client, 7, RejectCode::kWrongArgumentType);
}

TEST_F(BadInputE2eTest, NestingDeeperThanTheLimitIsRejectedWithoutHarm) {
  TestClient client(service->SocketPath());
  // [8, 6, {"a": [[[...]]]}, 1, 0, nil] nested 70 deep inside the message.
  std::vector<uint8_t> body{0x96, 0x08, 0x06, 0x81, 0xa1, 'a'};
  for (int i = 0; i < 70; ++i) body.push_back(0x91);
  body.push_back(0x01);
  body.insert(body.end(), {0x01, 0x00, 0xc0});
  client.SendBody(body);
  ExpectRejected(client, 8, RejectCode::kTooDeep);

  // A deep value sized to overflow a recursive parser's stack.
  std::vector<uint8_t> deep{0x93, 0x09, 0x01};  // [9, 1, <deep>]
  for (int i = 0; i < 200000; ++i) deep.push_back(0x91);
  deep.push_back(0x01);
  client.SendBody(deep);
  ExpectRejected(client, 9, RejectCode::kTooDeep);
}

TEST_F(BadInputE2eTest, UndecodableFramesCloseOnlyThatConnection) {
  {
    TestClient client(service->SocketPath());
    client.SendBody({0xc1});  // never-used MessagePack byte
    EXPECT_TRUE(client.WaitForClose());
  }
  {
    TestClient client(service->SocketPath());
    client.SendBody(MsgPack(Value::object({{"not", "an array"}})));
    EXPECT_TRUE(client.WaitForClose());
  }
  {
    TestClient client(service->SocketPath());
    client.SendBody(RawRequest(1, 10, {}));
    auto ok = client.Read();
    ASSERT_TRUE(ok);
    std::vector<uint8_t> trailing = RawRequest(2, 10, {});
    trailing.push_back(0x00);
    client.SendBody(trailing);
    EXPECT_TRUE(client.WaitForClose());
  }
  {
    TestClient client(service->SocketPath());
    client.SendBody(MsgPack(Value::array({-1, 10})));  // call must be unsigned or nil
    EXPECT_TRUE(client.WaitForClose());
  }
}

TEST_F(BadInputE2eTest, BadFrameLengthsCloseTheConnection) {
  {
    TestClient client(service->SocketPath());
    client.SendBytes({0, 0, 0, 0});
    EXPECT_TRUE(client.WaitForClose());
  }
  {
    TestClient client(service->SocketPath());
    client.SendBytes({0x00, 0x20, 0x00, 0x00});  // 2 MiB, over the 1 MiB limit
    EXPECT_TRUE(client.WaitForClose());
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

TEST_F(BadInputE2eTest, NilCallRunsTheOperationAndAnswersNothing) {
  TestClient client(service->SocketPath());
  client.SendNoReply(protocol::CreateReportingSession{55});
  client.Send(2, protocol::ReporterIDValid{55});
  auto reply = client.Read();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->call, 2u);  // nothing came for the nil call
  EXPECT_EQ(reply->value["reporterID"], 55);
}

}  // namespace
}  // namespace tavrin
