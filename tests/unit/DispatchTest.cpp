#include "protocol/Dispatch.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <optional>
#include <vector>

namespace tavrin::protocol {
namespace {

using ::testing::_;
using ::testing::Eq;
using ::testing::InvokeArgument;
using ::testing::SaveArg;
using Protocol = RuvoReportingServiceProtocol;
using IDs = std::optional<std::vector<int64_t>>;

class MockService : public Protocol {
 public:
  MOCK_METHOD(void, createReportingSession, (int64_t, BoolReply), (override));
  MOCK_METHOD(void, setServiceType, (uint16_t, int64_t, BoolReply), (override));
  MOCK_METHOD(void, getServiceNameForReporterID, (int64_t, ServiceTypeReply), (override));
  MOCK_METHOD(void, setConfiguration, (const Dictionary&, int64_t, BoolReply), (override));
  MOCK_METHOD(void, startReportingSessionForID, (int64_t, BoolReply), (override));
  MOCK_METHOD(void, sendMessage, (Dictionary, uint32_t, uint16_t, const IDs&, ErrorReply),
              (override));
  MOCK_METHOD(void, stopReportingSessionForID, (int64_t, BoolReply), (override));
  MOCK_METHOD(void, destroyReportingSession, (int64_t, BoolReply), (override));
  MOCK_METHOD(void, reporterID, (int64_t, DictionaryReply), (override));
  MOCK_METHOD(void, getAllReporters, (ReportersReply), (override));
  MOCK_METHOD(void, killService, (BoolReply), (override));
};

// A strict service: a call the test did not expect, or with other arguments, fails it.
class DispatchTest : public ::testing::Test {
 protected:
  void Run(Request request) {
    Dispatch(std::move(request), service_, [this](std::vector<uint8_t> body) {
      auto decoded = DecodeReply(body);
      ASSERT_TRUE(std::holds_alternative<Reply>(decoded)) << std::get<std::string>(decoded);
      sent_.push_back(std::get<Reply>(std::move(decoded)));
    });
  }

  ::testing::StrictMock<MockService> service_;
  std::vector<Reply> sent_;
};

TEST_F(DispatchTest, EveryOperationReachesTheServiceAndItsReplyGoesOutUnderItsCall) {
  const Dictionary configuration{{"device_name", "dock"}};
  const Dictionary message{{"k", 1}};
  const Dictionary validity{{"reporterID", 8}, {"serviceType", 2}};
  EXPECT_CALL(service_, createReportingSession(-4, _)).WillOnce(InvokeArgument<1>(true));
  EXPECT_CALL(service_, setServiceType(12, 4, _)).WillOnce(InvokeArgument<2>(false));
  EXPECT_CALL(service_, getServiceNameForReporterID(0, _))
      .WillOnce(InvokeArgument<1>(uint16_t{0xffff}));
  EXPECT_CALL(service_, setConfiguration(configuration, 8, _)).WillOnce(InvokeArgument<2>(true));
  EXPECT_CALL(service_, startReportingSessionForID(4, _)).WillOnce(InvokeArgument<1>(true));
  EXPECT_CALL(service_, sendMessage(message, 0x10002, 3, Eq(IDs{{5, 6}}), _))
      .WillOnce(InvokeArgument<4>(std::nullopt));
  EXPECT_CALL(service_, stopReportingSessionForID(4, _)).WillOnce(InvokeArgument<1>(true));
  EXPECT_CALL(service_, destroyReportingSession(4, _)).WillOnce(InvokeArgument<1>(true));
  EXPECT_CALL(service_, reporterID(8, _)).WillOnce(InvokeArgument<1>(validity));
  EXPECT_CALL(service_, getAllReporters(_))
      .WillOnce(InvokeArgument<0>(std::vector<int64_t>{-1, 8}));
  EXPECT_CALL(service_, killService(_)).WillOnce(InvokeArgument<0>(true));
  const Arguments operations[] = {
      CreateReportingSession{-4},
      SetServiceType{12, 4},
      GetServiceNameForReporterID{0},
      SetConfiguration{configuration, 8},
      StartReportingSessionForID{4},
      SendMessage{message, 0x10002, 3, std::vector<int64_t>{5, 6}},
      StopReportingSessionForID{4},
      DestroyReportingSession{4},
      ReporterIDValid{8},
      GetAllReporters{},
      KillService{},
  };
  for (size_t i = 0; i < std::size(operations); ++i) Run({i + 1, operations[i]});

  ASSERT_EQ(sent_.size(), std::size(operations));
  for (size_t i = 0; i < sent_.size(); ++i) {
    EXPECT_EQ(sent_[i].call, i + 1);
    EXPECT_EQ(sent_[i].status, Status::kOk) << i;
  }
  EXPECT_EQ(BoolReplyValue(sent_[0].value), true);
  EXPECT_EQ(BoolReplyValue(sent_[1].value), false);
  EXPECT_EQ(ServiceTypeReplyValue(sent_[2].value), 0xffff);
  EXPECT_TRUE(IsNilReplyValue(sent_[5].value));
  EXPECT_EQ(ValidityReplyValue(sent_[8].value), validity);
  EXPECT_EQ(ReportersReplyValue(sent_[9].value), (std::vector<int64_t>{-1, 8}));
}

// A reply goes out whenever and as often as the service invokes it, under its own call; a nil
// call still runs its operation but sends nothing.
TEST_F(DispatchTest, RepliesGoWhenAndAsOftenAsInvokedAndNeverForANilCall) {
  Protocol::BoolReply held, stop;
  Protocol::ServiceTypeReply name;
  EXPECT_CALL(service_, startReportingSessionForID(7, _)).WillOnce(SaveArg<1>(&held));
  EXPECT_CALL(service_, stopReportingSessionForID(7, _)).WillOnce(SaveArg<1>(&stop));
  EXPECT_CALL(service_, getServiceNameForReporterID(0, _)).WillOnce(SaveArg<1>(&name));
  EXPECT_CALL(service_, createReportingSession(1, _)).WillOnce(InvokeArgument<1>(true));
  EXPECT_CALL(service_, getAllReporters(_)).WillOnce(InvokeArgument<0>(std::vector<int64_t>{1}));
  Run({21, StartReportingSessionForID{7}});
  Run({22, StopReportingSessionForID{7}});
  Run({9, GetServiceNameForReporterID{0}});
  Run({std::nullopt, CreateReportingSession{1}});
  Run({std::nullopt, GetAllReporters{}});
  Run({std::nullopt, GetStatus{}});
  EXPECT_TRUE(sent_.empty());
  held(true);
  stop(true);
  name(0xffff);
  name(0xffff);
  ASSERT_EQ(sent_.size(), 4u);
  EXPECT_EQ(sent_[0].call, 21u);
  EXPECT_EQ(sent_[1].call, 22u);
  EXPECT_EQ(sent_[2].call, 9u);
  EXPECT_EQ(sent_[3].call, 9u);
  EXPECT_EQ(ServiceTypeReplyValue(sent_[3].value), 0xffff);
}

TEST_F(DispatchTest, AFailedSendAndAStatusRequestAreOperationErrors) {
  EXPECT_CALL(service_, sendMessage(Dictionary::object(), 1, 1, Eq(std::nullopt), _))
      .WillOnce(InvokeArgument<4>(
          Error{std::string(kReportingErrorDomain), kReportingDisabledCode, "off"}));
  Run({31, SendMessage{Dictionary::object(), 1, 1, std::nullopt}});
  // Only the listener can answer a status request; the service never sees one.
  Run({32, GetStatus{}});
  ASSERT_EQ(sent_.size(), 2u);
  const std::pair<const char*, int64_t> errors[] = {{"com.quorvex.audio.reporting", 1},
                                                    {"com.quorvex.tavrin.protocol", 1}};
  for (size_t i = 0; i < 2; ++i) {
    EXPECT_EQ(sent_[i].call, 31u + i);
    EXPECT_EQ(sent_[i].status, Status::kOperationError);
    const OptionalError error = ReplyError(sent_[i]);
    ASSERT_TRUE(error) << i;
    EXPECT_EQ(error->domain, errors[i].first);
    EXPECT_EQ(error->code, errors[i].second);
  }
}

}  // namespace
}  // namespace tavrin::protocol
