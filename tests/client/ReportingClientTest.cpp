#include <gmock/gmock.h>

#include <functional>
#include <memory>

#include "client/ReportingClient.h"
#include "tests/wire/SocketEnd.h"

namespace vx {

namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using Code = ClientStatus::Code;

constexpr std::chrono::milliseconds kShort{20};
constexpr uint32_t kCategory = 0x08000005;

Bytes hello(int version, uint64_t maxFrameBytes = wire::kMaxFrameBytes) {
  return frame(0, version,
               PayloadBuilder().set("max_frame_bytes", maxFrameBytes).build().encoded());
}
Bytes yes(int64_t number) { return frame(2, number, true); }

class ReportingClientTest : public testing::Test {
 protected:
  // Returns the client's end. The hello is there before the client asks.
  static int dial(SocketEnd& end, const Bytes& greeting = hello(1)) {
    UniqueFd client = end.pair();
    end.write(greeting);
    return client.release();
  }
  void connect(const ReportingClient::Options& options = {}, const Bytes& greeting = hello(1)) {
    client = std::make_unique<ReportingClient>(options);
    const ClientStatus status = client->adopt(dial(service, greeting));
    ASSERT_TRUE(status.ok()) << status.text;
    EXPECT_THAT(service.texts(), ElementsAre("0 1"));
    outcomes.clear();
  }
  // Calls whose outcomes go into `outcomes`.
  ClientStatus create(int64_t id) {
    return client->createReportingSessionAsync(id, [this, id](const auto& result) {
      outcomes.push_back(std::to_string(id) + " " + (result.ok() ? "ok" : result.status.text));
    });
  }
  void create(int64_t first, int64_t last) {
    for (int64_t id = first; id <= last; ++id) ASSERT_TRUE(create(id).ok());
  }
  ClientStatus receive(const Bytes& bytes) {
    service.write(bytes);
    return client->process();
  }

  const Payload message = PayloadBuilder().set("gain", 0.5).set("on", true).build();
  SocketEnd service;
  std::unique_ptr<ReportingClient> client;
  std::vector<std::string> outcomes;
};

TEST_F(ReportingClientTest, AnswersInAnyOrderReachTheirOwnCalls) {
  connect();
  create(1, 200);
  Bytes answers = yes(200);
  std::vector<std::string> expected;
  for (int64_t number = 200; number > 1; --number) {
    answers = answers + yes(number);
    expected.push_back(std::to_string(number) + " ok");
  }
  expected.emplace_back("1 dropped");
  EXPECT_TRUE(receive(answers + frame(3, 1, 8, "dropped")).ok());
  EXPECT_EQ(outcomes, expected);
  EXPECT_EQ(client->unknownAnswers(), 1U);
  EXPECT_EQ(client->pendingCalls(), 0U);
}

TEST_F(ReportingClientTest, AHeldStartOutlivesManyLaterCalls) {
  for (const bool answered : {true, false}) {
    connect();
    std::vector<Code> told;
    client->startReportingSession(1, [&](const auto& r) { told.push_back(r.status.code); });
    for (int64_t number = 2; number <= 1000; ++number) {
      ASSERT_TRUE(create(number).ok());
      ASSERT_TRUE(receive(number <= 990 ? yes(number) : Bytes()).ok());
    }
    EXPECT_THAT(told, IsEmpty());
    if (answered) receive(yes(990) + yes(1) + yes(1));
    EXPECT_EQ(client->pendingCalls(), answered ? 10U : 11U);
    service.close();
    EXPECT_EQ(client->process().code, Code::Disconnected);
    EXPECT_THAT(told, ElementsAre(answered ? Code::Ok : Code::Disconnected));
    EXPECT_EQ(outcomes.size(), 999U);
    EXPECT_EQ(client->unknownAnswers(), answered ? 2U : 0U);
    EXPECT_EQ(client->pendingCalls(), 0U);
  }
}

TEST_F(ReportingClientTest, EveryBlockingFormMakesItsCallAndReadsItsAnswer) {
  connect();
  int number = 0;
  const auto reply = [&](const auto& value) { service.write(frame(2, ++number, value)); };
  reply(true);
  EXPECT_TRUE(client->createReportingSession(-7).value);
  reply(true);
  EXPECT_TRUE(client->setServiceType(65535, 7).value);
  reply(65534);
  EXPECT_EQ(client->getServiceType(7).value, 65534);
  reply(true);
  EXPECT_TRUE(client->setConfiguration(message, 7).value);
  reply(nullptr);
  EXPECT_TRUE(client->sendMessage(message, kCategory, 6).ok());
  reply(PayloadBuilder().set("code", 9).set("domain", "d").build().encoded());
  const ClientStatus refused = client->sendMessage(Payload(), 0xFFFFFFFF, 65535, {7, -1});
  EXPECT_EQ(refused.code, Code::ReportingError);
  EXPECT_EQ(refused.domain, "d");
  EXPECT_EQ(refused.wireCode, 9);
  reply(false);
  const auto stopped = client->stopReportingSession(7);
  EXPECT_TRUE(stopped.ok() && !stopped.value);
  reply(true);
  EXPECT_TRUE(client->destroyReportingSession(7).value);
  reply(Bytes{0x82, 0x20, 0x18, 42});
  EXPECT_THAT(client->getAllReporters().value, ElementsAre(-1, 42));
  reply(PayloadBuilder().set("reporterID", 7).set("serviceType", 9).build().encoded());
  const ReporterValidation validation = client->validateReporter(7).value;
  EXPECT_EQ(validation.reporterID, 7);
  EXPECT_EQ(validation.serviceType, 9);
  client->startReportingSession(7, nullptr);
  client->sendMessageAsync(Payload(), 1, 1, std::vector<int64_t>{});  // not the same as without
  EXPECT_TRUE(client->killService().ok());
  EXPECT_THAT(service.texts(),
              ElementsAre("1 1 1 -7", "1 2 2 65535 7", "1 3 3 7", "1 4 4 {gain=0.5,on=1} 7",
                          "1 5 6 {gain=0.5,on=1} 134217733 6 null",
                          "1 6 6 {} 4294967295 65535 (7,-1)", "1 7 7 7", "1 8 8 7", "1 9 10",
                          "1 10 9 7", "1 11 5 7", "1 12 6 {} 1 1 ()", "1 13 11"));
}

TEST_F(ReportingClientTest, AnAnswerOfAnotherKindRefusesThatCallAlone) {
  connect();
  const auto type = [&] { return client->getServiceType(1).status; };
  const auto create = [&] { return client->createReportingSession(1).status; };
  const std::pair<Bytes, std::function<ClientStatus()>> cases[] = {
      {{0x61, 'x'}, create},
      {{0x1a, 0, 1, 0, 0}, type},
      {{0x20}, type},
      {{0xa0}, [&] { return client->validateReporter(1).status; }},
      {{0x81, 0x61, 'x'}, [&] { return client->getAllReporters().status; }},
      {{0x61, 'x'}, [&] { return client->sendMessage(message, 1, 1); }}};
  int number = 0;
  for (const auto& [value, call] : cases) {
    service.write(frame(2, ++number, value));
    EXPECT_EQ(call().code, Code::Refused) << number;
  }
  service.write(frame(3, 7, 5, "enough"));
  const ClientStatus refused = create();
  EXPECT_EQ(refused.code, Code::Refused);
  EXPECT_EQ(refused.wireCode, 5);
  EXPECT_TRUE(client->isConnected());
}

TEST_F(ReportingClientTest, CallsUpToTheLimits) {
  ReportingClient::Options options;
  options.maxPendingCalls = 2;
  const uint64_t bytes = frame(1, 1, 6, message.encoded(), kCategory, 1, nullptr).size() - 4;
  for (const uint64_t limit : {bytes - 1, bytes, bytes + 1}) {
    connect(options, hello(1, limit));
    const ClientStatus taken = client->sendMessageAsync(message, kCategory, 1);
    EXPECT_EQ(taken.code, limit < bytes ? Code::TooLarge : Code::Ok) << limit;
    EXPECT_TRUE(create(1).ok());
    EXPECT_THAT(service.texts(), IsEmpty()) << "calls are gathered, not written one by one";
    EXPECT_EQ(create(2).code, limit < bytes ? Code::Ok : Code::BufferFull);
    EXPECT_EQ(create(3).code, Code::BufferFull);
    EXPECT_EQ(client->pendingCalls(), 2U);
    EXPECT_TRUE(client->flush().ok());
    EXPECT_FALSE(client->wantsWrite());
    EXPECT_THAT(service.texts(), testing::SizeIs(2)) << "what was refused left no bytes";
  }
  EXPECT_THAT(receive(framed(Bytes(bytes + 2, 0x80))).text,
              HasSubstr("a frame of " + std::to_string(bytes + 2)));
}

TEST_F(ReportingClientTest, AServiceThatGreetsOtherwiseIsNotConnected) {
  const std::pair<Bytes, const char*> greetings[] = {{hello(2), "the service sent"},
                                                     {yes(1), "the service sent"},
                                                     {frame(4) + yes(1), "the service sent"},
                                                     {frame(3, nullptr, 6, "full"), "full"}};
  ReportingClient lone;
  for (const auto& [greeting, reason] : greetings) {
    const int fd = dial(service, greeting);
    shutdown(service.fd(), SHUT_WR);
    const ClientStatus status = lone.adopt(fd);
    EXPECT_EQ(status.code, Code::Disconnected);
    EXPECT_FALSE(lone.isConnected());
    EXPECT_THAT(status.text, HasSubstr(reason));
  }
  EXPECT_EQ(lone.adopt(dial(service, {}), kShort).code, Code::TimedOut);
  EXPECT_FALSE(lone.isConnected());
  service.texts();
  EXPECT_TRUE(service.ended()) << "the descriptor is given back";
}

TEST_F(ReportingClientTest, TheEndOfTheConnectionFailsEveryCallOnce) {
  const std::pair<Bytes, const char*> ends[] = {
      {{}, "the service went away"},
      {frame(3, nullptr, 1, "a frame was broken"), "a frame was broken"},
      {{0xFF, 0xFF, 0xFF, 0xFF}, "the service sent"},                      // beyond every limit
      {{0, 0, 0, 0}, "the service sent"},                                  // an empty frame
      {framed({0x83, 0x02, 0x01}), "the service sent"},                    // an array cut short
      {frame(2, 1), "the service sent"},                                   // no value
      {framed({0x83, 0x02, 0x01, 0xf5, 0x00}), "the service sent"},        // bytes after the array
      {framed({0x9f, 0x02, 0x01, 0xf5, 0xff}), "the service sent"},        // an indefinite length
      {frame(99, 1, true), "the service sent"},                            // an unknown kind
      {frame("x", 1, true), "the service sent"},                           // no integer
      {framed({0x80}), "the service sent"},                                // no kind
      {framed({0x83, 0x02, 0x01, 0x62, 0xc3, 0x28}), "the service sent"},  // not UTF-8
      {hello(1), "the service sent"},                                      // a second one
  };
  for (const auto& [bytes, why] : ends) {
    for (const bool writing : {false, true}) {  // into a socket without a reader
      connect();
      create(1, 3);
      ASSERT_TRUE(client->flush().ok());
      service.write(yes(2) + bytes);
      service.close();
      if (writing) create(4, 4);
      while (client->process().ok()) {
      }
      EXPECT_THAT(outcomes[0], "2 ok");
      outcomes.erase(outcomes.begin());
      EXPECT_THAT(outcomes, testing::SizeIs(writing ? 3 : 2));
      EXPECT_THAT(outcomes, testing::Each(HasSubstr(why))) << testing::PrintToString(bytes);
      EXPECT_FALSE(client->isConnected());
      EXPECT_EQ(create(5).code, Code::NotConnected);
      EXPECT_EQ(client->process().code, Code::NotConnected);
    }
  }
}

TEST_F(ReportingClientTest, AFullBufferRefusesWholeCallsAndRecovers) {
  ReportingClient::Options options;
  options.maxBufferedBytes = options.writeAtBytes = 512 << 10;  // more than a socket takes at once
  connect(options);
  std::size_t taken = 0;
  ClientStatus last;
  while ((last = client->sendMessageAsync(message, kCategory, 1)).ok() && taken < 100000) ++taken;
  EXPECT_EQ(last.code, Code::BufferFull);
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
  const auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(client->getServiceType(7, kShort).status.code, Code::TimedOut);
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(10));
  service.write(frame(2, 1, 7) + frame(2, 2, 8));  // the first one comes too late
  EXPECT_EQ(client->getServiceType(7).value, 8);
  service.close();
  EXPECT_EQ(client->getAllReporters().status.code, Code::Disconnected);
}

TEST_F(ReportingClientTest, GoodbyeWaitsForTheServiceAndEndsTheCalls) {
  connect();
  create(1, 1);
  service.write(yes(1));
  shutdown(service.fd(), SHUT_WR);
  EXPECT_TRUE(client->goodbye().ok());
  EXPECT_THAT(service.texts(), ElementsAre("1 1 1 1", "4"));
  EXPECT_THAT(outcomes, ElementsAre("1 ok"));
  EXPECT_EQ(create(2).code, Code::NotConnected);
  EXPECT_EQ(client->goodbye().code, Code::NotConnected);

  connect();
  create(3, 3);
  EXPECT_EQ(client->goodbye(kShort).code, Code::TimedOut);
  EXPECT_THAT(outcomes, ElementsAre("3 said goodbye"));
}

TEST_F(ReportingClientTest, ACallbackMayConnectAnew) {
  connect();
  SocketEnd second;
  SocketEnd third;
  client->createReportingSessionAsync(1, [&](const auto& result) {
    outcomes.push_back(result.status.text);
    EXPECT_TRUE(client->adopt(dial(second)).ok());
  });
  create(2, 2);
  EXPECT_TRUE(client->adopt(dial(third)).ok());
  EXPECT_THAT(outcomes, ElementsAre("the connection was made anew", "2 " + outcomes[0]));
  EXPECT_THAT(third.texts(), IsEmpty());
  EXPECT_TRUE(third.ended()) << "the callback's connection stays";
  second.write(yes(3));  // numbering goes on
  EXPECT_TRUE(client->createReportingSession(3).value);
  EXPECT_THAT(second.texts(), ElementsAre("0 1", "1 3 1 3"));
  client->disconnect();
  EXPECT_EQ(client->fd(), -1);
}

TEST_F(ReportingClientTest, ACallbackMayDestroyTheClient) {
  for (const bool answered : {true, false}) {
    connect();
    client->createReportingSessionAsync(1, [this](const auto&) { client.reset(); });
    create(2, 2);
    if (answered) {
      receive(yes(1) + yes(2));
    } else {
      service.close();
      EXPECT_EQ(client->createReportingSession(3).status.code, Code::Disconnected);
    }
    EXPECT_EQ(client, nullptr);
    EXPECT_THAT(outcomes, IsEmpty()) << "no callback runs after the client is gone";
  }
}

TEST_F(ReportingClientTest, ACallbackMayCallAndReadOn) {
  connect();
  client->createReportingSessionAsync(1, [this](const auto&) { create(2, 2); });
  EXPECT_TRUE(receive(yes(1)).ok());
  EXPECT_THAT(service.texts(), ElementsAre("1 1 1 1", "1 2 1 2")) << "written at once";
  client->createReportingSessionAsync(3, [this](const auto&) {
    service.write(yes(4));
    EXPECT_TRUE(client->createReportingSession(4).value);
    EXPECT_THAT(outcomes, ElementsAre("2 ok"));
  });
  EXPECT_TRUE(receive(yes(3) + yes(2)).ok());
  EXPECT_EQ(client->unknownAnswers(), 0U);
  EXPECT_THAT(service.texts(), ElementsAre("1 3 1 3", "1 4 1 4"));
  client->createReportingSessionAsync(
      5, [this](const auto&) { EXPECT_EQ(create(6).code, Code::NotConnected); });
  service.write(yes(5));
  EXPECT_EQ(client->goodbye(kShort).code, Code::TimedOut);
  EXPECT_THAT(service.texts(), ElementsAre("1 5 1 5", "4"));
}

TEST_F(ReportingClientTest, ConnectingSaysWhereAndWhatToDo) {
  ReportingClient lone;
  EXPECT_EQ(lone.connect(std::string(108, 'x')).code, Code::NotConnected);
  setenv("VXREPORTING_SOCKET", "/nonexistent/named.socket", 1);
  const ClientStatus missing = lone.connect();
  EXPECT_EQ(missing.code, Code::NotConnected);
  EXPECT_THAT(missing.text, testing::MatchesRegex(".*/nonexistent/named.socket.*vxreportingd.*"));
  unsetenv("VXREPORTING_SOCKET");
}

}  // namespace
}  // namespace vx
