#include "protocol/Dispatch.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <vector>

namespace tavrin::protocol {
namespace {

// Records each call with its arguments and keeps its reply callback for the test to invoke, so a
// reply can be sent later, twice, or never, as the service does.
class RecordingService : public RuvoReportingServiceProtocol {
 public:
  std::vector<std::string> calls;
  BoolReply boolReply;
  ServiceTypeReply serviceTypeReply;
  ErrorReply errorReply;
  DictionaryReply dictionaryReply;
  ReportersReply reportersReply;
  Dictionary lastDictionary;
  std::optional<std::vector<int64_t>> lastReporterIDs;

  void createReportingSession(int64_t id, BoolReply reply) override {
    Keep("create " + std::to_string(id), boolReply, std::move(reply));
  }
  void setServiceType(uint16_t serviceType, int64_t id, BoolReply reply) override {
    Keep("setServiceType " + std::to_string(serviceType) + " " + std::to_string(id), boolReply,
         std::move(reply));
  }
  void getServiceNameForReporterID(int64_t id, ServiceTypeReply reply) override {
    Keep("getServiceName " + std::to_string(id), serviceTypeReply, std::move(reply));
  }
  void setConfiguration(const Dictionary& configuration, int64_t id, BoolReply reply) override {
    lastDictionary = configuration;
    Keep("setConfiguration " + std::to_string(id), boolReply, std::move(reply));
  }
  void startReportingSessionForID(int64_t id, BoolReply reply) override {
    Keep("start " + std::to_string(id), boolReply, std::move(reply));
  }
  void sendMessage(const Dictionary& message, uint32_t category, uint16_t type,
                   const std::optional<std::vector<int64_t>>& ids, ErrorReply reply) override {
    lastDictionary = message;
    lastReporterIDs = ids;
    Keep("send " + std::to_string(category) + " " + std::to_string(type), errorReply,
         std::move(reply));
  }
  void stopReportingSessionForID(int64_t id, BoolReply reply) override {
    Keep("stop " + std::to_string(id), boolReply, std::move(reply));
  }
  void destroyReportingSession(int64_t id, BoolReply reply) override {
    Keep("destroy " + std::to_string(id), boolReply, std::move(reply));
  }
  void reporterID(int64_t id, DictionaryReply valid) override {
    Keep("valid " + std::to_string(id), dictionaryReply, std::move(valid));
  }
  void getAllReporters(ReportersReply reply) override {
    Keep("all", reportersReply, std::move(reply));
  }
  void killService(BoolReply reply) override { Keep("kill", boolReply, std::move(reply)); }

 private:
  template <typename Callback>
  void Keep(std::string call, Callback& slot, Callback reply) {
    calls.push_back(std::move(call));
    slot = std::move(reply);
  }
};

class DispatchTest : public ::testing::Test {
 protected:
  void Run(Request request) {
    Dispatch(std::move(request), service_, [this](std::vector<uint8_t> body) {
      auto decoded = DecodeReply(body);
      ASSERT_TRUE(std::holds_alternative<Reply>(decoded)) << std::get<std::string>(decoded);
      sent_.push_back(std::get<Reply>(std::move(decoded)));
    });
  }

  RecordingService service_;
  std::vector<Reply> sent_;
};

TEST_F(DispatchTest, BooleanOperationsReachTheServiceAndReplyUnderTheirCall) {
  Run({1, CreateReportingSession{-4}});
  Run({2, SetServiceType{12, 4}});
  Run({3, StartReportingSessionForID{4}});
  Run({4, StopReportingSessionForID{4}});
  Run({5, DestroyReportingSession{4}});
  Run({6, KillService{}});
  EXPECT_EQ(service_.calls, (std::vector<std::string>{"create -4", "setServiceType 12 4", "start 4",
                                                      "stop 4", "destroy 4", "kill"}));
  // Only the last callback is kept; it answers under call 6.
  service_.boolReply(true);
  ASSERT_EQ(sent_.size(), 1u);
  EXPECT_EQ(sent_[0].call, 6u);
  EXPECT_EQ(sent_[0].status, Status::kOk);
  EXPECT_EQ(BoolReplyValue(sent_[0].value), true);
}

TEST_F(DispatchTest, HeldStartReplyIsSentWhenInvokedLater) {
  Run({21, StartReportingSessionForID{7}});
  auto held = service_.boolReply;
  Run({22, StopReportingSessionForID{7}});
  auto stop = service_.boolReply;
  EXPECT_TRUE(sent_.empty());
  held(true);
  stop(true);
  ASSERT_EQ(sent_.size(), 2u);
  EXPECT_EQ(sent_[0].call, 21u);
  EXPECT_EQ(sent_[1].call, 22u);
}

TEST_F(DispatchTest, ReplyInvokedTwiceIsSentTwice) {
  Run({9, GetServiceNameForReporterID{0}});
  service_.serviceTypeReply(0xffff);
  service_.serviceTypeReply(0xffff);
  ASSERT_EQ(sent_.size(), 2u);
  for (const Reply& reply : sent_) {
    EXPECT_EQ(reply.call, 9u);
    EXPECT_EQ(ServiceTypeReplyValue(reply.value), 0xffff);
  }
}

TEST_F(DispatchTest, NilCallRunsTheOperationAndSendsNothing) {
  Run({std::nullopt, CreateReportingSession{1}});
  service_.boolReply(true);
  Run({std::nullopt, GetAllReporters{}});
  service_.reportersReply({1, 2});
  EXPECT_EQ(service_.calls, (std::vector<std::string>{"create 1", "all"}));
  EXPECT_TRUE(sent_.empty());
}

TEST_F(DispatchTest, SendMessageRepliesNilOnSuccessAndStatus1OnError) {
  Dictionary message = Dictionary::object();
  message["k"] = 1;
  Run({30, SendMessage{message, 0x10002, 3, std::vector<int64_t>{5, 6}}});
  EXPECT_EQ(service_.calls.back(), "send 65538 3");
  EXPECT_EQ(service_.lastDictionary, message);
  EXPECT_EQ(service_.lastReporterIDs, (std::vector<int64_t>{5, 6}));
  service_.errorReply(std::nullopt);

  Run({31, SendMessage{message, 1, 1, std::nullopt}});
  EXPECT_FALSE(service_.lastReporterIDs.has_value());
  service_.errorReply(Error{std::string(kReportingErrorDomain), kReportingDisabledCode, "off"});

  ASSERT_EQ(sent_.size(), 2u);
  EXPECT_EQ(sent_[0].call, 30u);
  EXPECT_EQ(sent_[0].status, Status::kOk);
  EXPECT_TRUE(IsNilReplyValue(sent_[0].value));
  EXPECT_EQ(sent_[1].call, 31u);
  EXPECT_EQ(sent_[1].status, Status::kOperationError);
  const OptionalError error = ReplyError(sent_[1]);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain, "com.quorvex.audio.reporting");
  EXPECT_EQ(error->code, 1);
}

TEST_F(DispatchTest, QueriesReplyWithTheirValueKinds) {
  Dictionary configuration = Dictionary::object();
  configuration["device_name"] = "dock";
  Run({40, SetConfiguration{configuration, 8}});
  EXPECT_EQ(service_.lastDictionary, configuration);

  Run({41, ReporterIDValid{8}});
  service_.dictionaryReply(Dictionary{{"reporterID", 8}, {"serviceType", 2}});
  Run({42, GetAllReporters{}});
  service_.reportersReply({-1, 8});
  ASSERT_EQ(sent_.size(), 2u);
  EXPECT_TRUE(ValidityReplyValue(sent_[0].value));
  EXPECT_EQ(sent_[0].value["reporterID"], 8);
  EXPECT_EQ(ReportersReplyValue(sent_[1].value), (std::vector<int64_t>{-1, 8}));
}

}  // namespace
}  // namespace tavrin::protocol
