#include <gmock/gmock.h>

#include <algorithm>
#include <memory>
#include <thread>

#include "client/ReportingClient.h"
#include "tests/client/FakeService.h"

namespace vx {

namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using wire::ErrorCode;
using Code = ClientStatus::Code;
using std::chrono::milliseconds;

constexpr milliseconds kShort{20};
constexpr uint32_t kCategory = 0x08000005;

const Payload& message() {
  static const Payload built = PayloadBuilder().set("gain", 0.5).set("on", true).build();
  return built;
}

class ReportingClientTest : public testing::Test {
 protected:
  void connect(const ReportingClient::Options& options = {}) {
    client = std::make_unique<ReportingClient>(options);
    const ClientStatus status = client->adopt(service.connect());
    ASSERT_TRUE(status.ok()) << status.text;
    service.frames();  // the hello
  }
  // A call whose outcome goes into `outcomes`.
  ClientStatus create(int64_t reporterID) {
    return client->createReportingSessionAsync(reporterID, [this](const auto& result) {
      outcomes.push_back(result.ok() ? "ok" : result.status.text);
    });
  }
  void createThree() {
    for (int64_t id = 1; id <= 3; ++id) ASSERT_TRUE(create(id).ok());
    ASSERT_TRUE(client->flush().ok());
  }

  FakeService service;
  std::unique_ptr<ReportingClient> client;
  std::vector<std::string> outcomes;
};

TEST_F(ReportingClientTest, WritesTheFramesOfTheProtocol) {
  client = std::make_unique<ReportingClient>();
  ASSERT_TRUE(client->adopt(service.connect()).ok());
  EXPECT_TRUE(client->sendMessageAsync(message(), kCategory, 1).ok());
  EXPECT_TRUE(client->sendMessageAsync(Payload(), 9, 0, {42, -1}).ok());
  EXPECT_TRUE(client->setServiceTypeAsync(7, 42, nullptr).ok());
  EXPECT_THAT(service.frames(), ElementsAre(Bytes{0x82, 0x00, 0x01}))
      << "calls are gathered, not written one by one";
  EXPECT_TRUE(client->wantsWrite());
  EXPECT_TRUE(client->process().ok());
  EXPECT_THAT(service.frames(),
              ElementsAre(Bytes{0x87, 0x01, 0x01, 0x06, 0xa2, 0x64, 'g',  'a',  'i',  'n',
                                0xfb, 0x3f, 0xe0, 0,    0,    0,    0,    0,    0,    0x62,
                                'o',  'n',  0xf5, 0x1a, 0x08, 0x00, 0x00, 0x05, 0x01, 0xf6},
                          Bytes{0x87, 0x01, 0x02, 0x06, 0xa0, 0x09, 0x00, 0x82, 0x18, 0x2a, 0x20},
                          Bytes{0x85, 0x01, 0x03, 0x02, 0x07, 0x18, 0x2a}));
  EXPECT_FALSE(client->wantsWrite());
}

TEST_F(ReportingClientTest, AnswersInAnyOrderReachTheirOwnCalls) {
  connect();
  createThree();
  service.write(trueReply(3));
  service.write(trueReply(3));
  service.write(errorFrame(1, ErrorCode::Abandoned, "dropped"));
  service.write(trueReply(2));
  EXPECT_TRUE(client->process().ok());
  EXPECT_THAT(outcomes, ElementsAre("ok", "dropped", "ok"));
  EXPECT_EQ(client->unknownAnswers(), 1U);
  EXPECT_EQ(client->pendingCalls(), 0U);
}

TEST_F(ReportingClientTest, AHeldStartOutlivesManyLaterCalls) {
  connect();
  bool ended = false;
  client->startReportingSession(1, [&](const auto& result) { ended = result.value; });
  for (int64_t number = 2; number <= 1000; ++number) {
    ASSERT_TRUE(create(number).ok());
    service.write(trueReply(number));
    ASSERT_TRUE(client->process().ok());
  }
  EXPECT_EQ(outcomes.size(), 999U);
  EXPECT_FALSE(ended);
  EXPECT_EQ(client->pendingCalls(), 1U);
  service.write(trueReply(999));  // answered already
  ASSERT_TRUE(client->process().ok());
  EXPECT_EQ(client->unknownAnswers(), 1U);
  EXPECT_EQ(outcomes.size(), 999U);
  service.write(trueReply(1));
  client->process();
  EXPECT_TRUE(ended);
  EXPECT_EQ(client->pendingCalls(), 0U);
}

TEST_F(ReportingClientTest, AHeldStartIsToldThatTheServiceDied) {
  connect();
  std::vector<Code> told;
  client->startReportingSession(1, [&](const auto& r) { told.push_back(r.status.code); });
  for (int64_t number = 2; number <= 300; ++number) {
    ASSERT_TRUE(create(number).ok());
    if (number <= 290) service.write(trueReply(static_cast<uint64_t>(number)));
    ASSERT_TRUE(client->process().ok());
  }
  ASSERT_EQ(outcomes.size(), 289U);
  EXPECT_EQ(client->pendingCalls(), 11U);
  service.close();
  EXPECT_EQ(client->process().code, Code::Disconnected);
  EXPECT_THAT(told, ElementsAre(Code::Disconnected));
  EXPECT_EQ(outcomes.size(), 299U);
  EXPECT_EQ(client->pendingCalls(), 0U);
  client.reset();
  EXPECT_EQ(told.size(), 1U);
}

TEST_F(ReportingClientTest, ManyCallsAnsweredBackwards) {
  connect();
  std::vector<int64_t> order;
  for (int64_t id = 1; id <= 200; ++id) {
    client->createReportingSessionAsync(id, [&order, id](const auto&) { order.push_back(id); });
  }
  for (uint64_t number = 200; number > 0; --number) service.write(trueReply(number));
  ASSERT_TRUE(client->process().ok());
  ASSERT_EQ(order.size(), 200U);
  EXPECT_TRUE(std::is_sorted(order.rbegin(), order.rend()));
}

TEST_F(ReportingClientTest, EveryBlockingFormMakesItsCallAndReadsItsAnswer) {
  connect();
  const auto reply = [this](uint64_t number, const Bytes& value) {
    service.write(replyFrame(number, [&](CborWriter& w) { w.encoded(value); }));
  };
  const Bytes yes{0xf5};
  reply(1, yes);
  EXPECT_TRUE(client->createReportingSession(-7).value);
  reply(2, yes);
  EXPECT_TRUE(client->setServiceType(65535, 7).value);
  reply(3, {0x19, 0xff, 0xfe});
  EXPECT_EQ(client->getServiceType(7).value, 65534);
  reply(4, yes);
  EXPECT_TRUE(client->setConfiguration(message(), 7).value);
  reply(5, {0xf6});
  EXPECT_TRUE(client->sendMessage(message(), kCategory, 6).ok());
  reply(6, {0xa2, 0x64, 'c', 'o', 'd', 'e', 1, 0x66, 'd', 'o', 'm', 'a', 'i', 'n', 0x61, 'd'});
  EXPECT_EQ(client->sendMessage(Payload(), 0xFFFFFFFF, 65535, {7, -1}).code, Code::ReportingError);
  reply(7, {0xf4});
  const auto stopped = client->stopReportingSession(7);
  EXPECT_TRUE(stopped.ok());
  EXPECT_FALSE(stopped.value);
  reply(8, yes);
  EXPECT_TRUE(client->destroyReportingSession(7).value);
  reply(9, {0x82, 0x20, 0x18, 42});
  EXPECT_THAT(client->getAllReporters().value, ElementsAre(-1, 42));
  client->startReportingSession(7, nullptr);
  client->sendMessageAsync(Payload(), 1, 1, std::vector<int64_t>{});  // not the same as without
  EXPECT_TRUE(client->killService().ok());
  EXPECT_THAT(
      service.texts(),
      ElementsAre("1 1 1 -7", "1 2 2 65535 7", "1 3 3 7", "1 4 4 {gain=0.5,on=1} 7",
                  "1 5 6 {gain=0.5,on=1} 134217733 6 null", "1 6 6 {} 4294967295 65535 (7,-1)",
                  "1 7 7 7", "1 8 8 7", "1 9 10", "1 10 5 7", "1 11 6 {} 1 1 ()", "1 12 11"));
}

TEST_F(ReportingClientTest, AnAnswerOfAnotherKindRefusesThatCallAlone) {
  connect();
  uint64_t number = 0;
  const auto answered = [&](const Bytes& value, const auto& makeCall) {
    service.write(replyFrame(++number, [&](CborWriter& w) { w.encoded(value); }));
    return makeCall();
  };
  const auto create = [&] { return client->createReportingSession(1).status.code; };
  const auto type = [&] { return client->getServiceType(1).status.code; };
  EXPECT_EQ(answered({0x61, 'x'}, create), Code::Refused);
  EXPECT_EQ(answered({0x1a, 0, 1, 0, 0}, type), Code::Refused) << "65536";
  EXPECT_EQ(answered({0x20}, type), Code::Refused) << "-1";
  EXPECT_EQ(answered({0xa0}, [&] { return client->validateReporter(1).status.code; }),
            Code::Refused);
  EXPECT_EQ(answered({0x81, 0x61, 'x'}, [&] { return client->getAllReporters().status.code; }),
            Code::Refused);
  EXPECT_EQ(answered({0x61, 'x'}, [&] { return client->sendMessage(message(), 1, 1).code; }),
            Code::Refused);
  service.write(errorFrame(7, ErrorCode::TooManySessions, "enough"));
  const ClientStatus refused = client->createReportingSession(2).status;
  EXPECT_EQ(refused.code, Code::Refused);
  EXPECT_EQ(refused.wireCode, 5);
  EXPECT_TRUE(client->isConnected());
}

TEST_F(ReportingClientTest, CallsUpToTheLimits) {
  ReportingClient::Options options;
  options.maxPendingCalls = 2;
  client = std::make_unique<ReportingClient>(options);
  const Bytes fits = [&] {
    Bytes out;
    FrameWriter call = FrameWriter::call(out, 1, wire::Operation::SendMessage, 4);
    call.items().encoded(message().encoded());
    call.items().unsignedInteger(kCategory);
    call.items().integer(1);
    call.items().null();
    return out;
  }();
  const uint64_t bytes = fits.size() - wire::kLengthBytes;
  for (const uint64_t limit : {bytes - 1, bytes, bytes + 1}) {
    ASSERT_TRUE(client->adopt(service.connect(helloFrame(1, limit))).ok());
    const ClientStatus taken = client->sendMessageAsync(message(), kCategory, 1);
    EXPECT_EQ(taken.code, limit < bytes ? Code::TooLarge : Code::Ok) << limit;
    EXPECT_TRUE(create(1).ok());
    EXPECT_EQ(create(2).code, limit < bytes ? Code::Ok : Code::BufferFull);
    EXPECT_EQ(create(3).code, Code::BufferFull);
    EXPECT_EQ(client->pendingCalls(), 2U);
    EXPECT_TRUE(client->flush().ok());
    EXPECT_THAT(service.texts(), testing::SizeIs(3)) << "what was refused left no bytes";
  }
  service.write(framed(Bytes(bytes + 2, 0x80)));
  EXPECT_THAT(client->process().text, HasSubstr("a frame of " + std::to_string(bytes + 2)));
}

TEST_F(ReportingClientTest, AServiceThatGreetsOtherwiseIsNotConnected) {
  const Bytes greetings[] = {helloFrame(2), trueReply(1), goodbyeFrame() + trueReply(1),
                             errorFrame(std::nullopt, ErrorCode::TooManyConnections, "full")};
  for (const Bytes& greeting : greetings) {
    ReportingClient lone;
    const int fd = service.connect(greeting);
    shutdown(service.fd(), SHUT_WR);
    const ClientStatus status = lone.adopt(fd);
    EXPECT_EQ(status.code, Code::Disconnected);
    EXPECT_FALSE(lone.isConnected());
    EXPECT_EQ(status.text.find("full") != std::string::npos, &greeting == &greetings[3]);
  }
  ReportingClient patient;
  EXPECT_EQ(patient.adopt(service.connect({}), kShort).code, Code::TimedOut);
  EXPECT_FALSE(patient.isConnected());
  service.texts();
  EXPECT_TRUE(service.ended()) << "the descriptor is given back";
}

TEST_F(ReportingClientTest, ACallbackMayConnectAnew) {
  connect();
  FakeService second;
  ClientStatus again;
  client->createReportingSessionAsync(1, [&](const auto& result) {
    outcomes.push_back(result.status.text);
    again = client->adopt(second.connect());
  });
  ASSERT_TRUE(create(2).ok());
  FakeService third;
  EXPECT_TRUE(client->adopt(third.connect()).ok());
  EXPECT_TRUE(again.ok());
  EXPECT_THAT(outcomes, ElementsAre("the connection was made anew", outcomes[0]));
  EXPECT_THAT(third.texts(), ElementsAre());
  EXPECT_TRUE(third.ended()) << "the callback's connection stays";
  second.write(trueReply(3));  // numbering goes on
  EXPECT_TRUE(client->createReportingSession(3).value);
  EXPECT_THAT(second.texts(), ElementsAre("0 1", "1 3 1 3"));
  client->disconnect();
  EXPECT_EQ(client->fd(), -1);
  EXPECT_EQ(create(4).code, Code::NotConnected);
}

TEST_F(ReportingClientTest, ASwitchedOffServiceRefusesWithDomainAndCode) {
  connect();
  service.write(replyFrame(1, [](CborWriter& w) {
    w.encoded(PayloadBuilder()
                  .set("domain", "com.quorvel.audio.reporting")
                  .set("code", 1)
                  .build()
                  .encoded());
  }));
  const ClientStatus status = client->sendMessage(message(), kCategory, 1);
  EXPECT_EQ(status.code, Code::ReportingError);
  EXPECT_EQ(status.domain, "com.quorvel.audio.reporting");
  EXPECT_EQ(status.wireCode, 1);
}

TEST_F(ReportingClientTest, AServiceThatDiesFailsEveryCallOnce) {
  connect();
  createThree();
  service.write(trueReply(2));
  service.close();
  // The calls made here are written into a socket without a reader; what was answered still counts.
  ASSERT_TRUE(create(4).ok());
  EXPECT_EQ(client->process().code, Code::Disconnected);
  ASSERT_EQ(outcomes.size(), 4U);
  EXPECT_EQ(outcomes[0], "ok");
  EXPECT_EQ(outcomes[1], outcomes[3]);
  EXPECT_FALSE(client->isConnected());
  EXPECT_EQ(create(5).code, Code::NotConnected);
  EXPECT_EQ(client->process().code, Code::NotConnected);
  EXPECT_EQ(outcomes.size(), 4U);
}

TEST_F(ReportingClientTest, TheServicesReasonForClosingIsPassedOn) {
  connect();
  createThree();
  service.write(errorFrame(std::nullopt, ErrorCode::MalformedFrame, "a frame was broken"));
  service.close();
  while (client->process().ok()) {
  }
  EXPECT_THAT(outcomes, testing::Each(HasSubstr("a frame was broken")));
  EXPECT_EQ(outcomes.size(), 3U);
}

TEST_F(ReportingClientTest, WhatIsNotTheProtocolEndsTheConnection) {
  const Bytes badFrames[] = {
      {0xFF, 0xFF, 0xFF, 0xFF},                      // a length beyond every limit
      {0, 0, 0, 0},                                  // an empty frame
      framed({0x83, 0x02, 0x01}),                    // an array cut short
      framed({0x82, 0x02, 0x01}),                    // a reply without its value
      framed({0x83, 0x02, 0x01, 0xf5, 0x00}),        // bytes behind the array
      framed({0x9f, 0x02, 0x01, 0xf5, 0xff}),        // an indefinite length
      framed({0x83, 0x18, 0x63, 0x01, 0xf5}),        // an unknown kind
      framed({0x83, 0x61, 'x', 0x01, 0xf5}),         // a kind that is no integer
      framed({0x80}),                                // no kind
      framed({0x83, 0x02, 0x01, 0x62, 0xc3, 0x28}),  // text that is not UTF-8
      helloFrame(),                                  // a second hello
  };
  for (const Bytes& bad : badFrames) {
    outcomes.clear();
    connect();
    createThree();
    service.write(trueReply(1));
    service.write(bad);
    EXPECT_EQ(client->process().code, Code::Disconnected) << testing::PrintToString(bad);
    EXPECT_THAT(outcomes, ElementsAre("ok", HasSubstr("the service sent"), outcomes[1]));
  }
}

TEST_F(ReportingClientTest, AFullBufferRefusesWholeCallsAndRecovers) {
  ReportingClient::Options options;
  options.maxBufferedBytes = options.writeAtBytes = 512 << 10;  // more than a socket takes at once
  connect(options);
  std::size_t taken = 0;
  ClientStatus refusal;
  while (taken < 100000) {
    refusal = client->sendMessageAsync(message(), kCategory, 1);
    if (!refusal.ok()) break;
    ++taken;
  }
  EXPECT_EQ(refusal.code, Code::BufferFull);
  EXPECT_EQ(client->pendingCalls(), taken);
  std::vector<std::string> arrived = service.texts();
  EXPECT_TRUE(create(1).ok()) << "the socket takes more again";
  while (client->wantsWrite()) {
    ASSERT_TRUE(client->process().ok());
    for (std::string& text : service.texts()) arrived.push_back(std::move(text));
  }
  ASSERT_EQ(arrived.size(), taken + 1);
  for (std::size_t i = 0; i < arrived.size(); ++i)
    EXPECT_THAT(arrived[i], testing::StartsWith("1 " + std::to_string(i + 1) + " "));
  EXPECT_FALSE(service.holdsHalfAFrame());
}

TEST_F(ReportingClientTest, BlockingFormsWaitForTheirAnswerAndNoLonger) {
  connect();
  service.write(trueReply(1));
  EXPECT_TRUE(client->createReportingSession(7).value);
  EXPECT_EQ(client->getServiceType(7, kShort).status.code, Code::TimedOut);
  // The answer that comes too late is nobody's.
  service.write(replyFrame(2, [](CborWriter& w) { w.integer(7); }));
  service.write(replyFrame(3, [](CborWriter& w) {
    w.encoded(PayloadBuilder().set("reporterID", 7).set("serviceType", 9).build().encoded());
  }));
  const auto validation = client->validateReporter(7);
  ASSERT_TRUE(validation.ok()) << validation.status.text;
  EXPECT_EQ(validation.value.reporterID, 7);
  EXPECT_EQ(validation.value.serviceType, 9);
  service.close();
  EXPECT_EQ(client->getAllReporters().status.code, Code::Disconnected);
}

TEST_F(ReportingClientTest, GoodbyeWaitsForTheServiceAndEndsTheCalls) {
  connect();
  ASSERT_TRUE(create(1).ok());
  std::thread daemon([this] {
    std::size_t frames = 0;
    while (frames < 2) frames += service.frames().size();
    service.write(trueReply(1));
    service.close();
  });
  EXPECT_TRUE(client->goodbye().ok());
  daemon.join();
  EXPECT_THAT(outcomes, ElementsAre("ok"));
  EXPECT_EQ(create(2).code, Code::NotConnected);
  EXPECT_EQ(client->goodbye().code, Code::NotConnected);

  connect();
  ASSERT_TRUE(create(3).ok());
  EXPECT_EQ(client->goodbye(kShort).code, Code::TimedOut);
  EXPECT_THAT(outcomes, ElementsAre("ok", "said goodbye"));
}

TEST_F(ReportingClientTest, ACallbackMayDestroyTheClient) {
  connect();
  client->createReportingSessionAsync(1, [this](const auto&) { client.reset(); });
  ASSERT_TRUE(create(2).ok());
  service.write(trueReply(1));
  service.write(trueReply(2));
  client->process();
  EXPECT_EQ(client, nullptr);
  EXPECT_THAT(outcomes, ElementsAre()) << "no callback runs after the client is gone";

  connect();
  client->createReportingSessionAsync(1, [this](const auto&) { client.reset(); });
  ASSERT_TRUE(create(2).ok());
  service.close();
  EXPECT_EQ(client->createReportingSession(3).status.code, Code::Disconnected);
  EXPECT_EQ(client, nullptr);
  EXPECT_THAT(outcomes, ElementsAre());
}

TEST_F(ReportingClientTest, WhatACallbackCallsIsWrittenAtOnce) {
  connect();
  client->createReportingSessionAsync(1, [this](const auto&) { EXPECT_TRUE(create(2).ok()); });
  service.write(trueReply(1));
  EXPECT_TRUE(client->process().ok());
  EXPECT_THAT(service.texts(), ElementsAre("1 1 1 1", "1 2 1 2"));
  client->createReportingSessionAsync(
      3, [this](const auto&) { EXPECT_EQ(create(4).code, Code::NotConnected); });
  service.write(trueReply(3));
  EXPECT_EQ(client->goodbye(kShort).code, Code::TimedOut);
  EXPECT_THAT(service.texts(), ElementsAre("1 3 1 3", "4"));
}

TEST_F(ReportingClientTest, ACallbackMayReadOn) {
  connect();
  client->createReportingSessionAsync(1, [this](const auto&) {
    outcomes.push_back("outer");
    service.write(trueReply(3));
    EXPECT_TRUE(client->createReportingSession(3).value);
  });
  ASSERT_TRUE(create(2).ok());
  service.write(trueReply(1));
  service.write(trueReply(2));
  EXPECT_TRUE(client->process().ok());
  EXPECT_THAT(outcomes, ElementsAre("outer", "ok"));
  EXPECT_EQ(client->unknownAnswers(), 0U);
}

TEST_F(ReportingClientTest, ConnectingSaysWhereAndWhatToDo) {
  ReportingClient lone;
  const ClientStatus missing = lone.connect("/nonexistent/service.socket");
  EXPECT_EQ(missing.code, Code::NotConnected);
  EXPECT_THAT(missing.text, HasSubstr("/nonexistent/service.socket"));
  EXPECT_THAT(missing.text, HasSubstr("vxreportingd"));
  EXPECT_EQ(lone.connect(std::string(108, 'x')).code, Code::NotConnected);
  setenv("VXREPORTING_SOCKET", "/nonexistent/named.socket", 1);
  EXPECT_THAT(lone.connect().text, HasSubstr("/nonexistent/named.socket"));
  unsetenv("VXREPORTING_SOCKET");
}

}  // namespace
}  // namespace vx
