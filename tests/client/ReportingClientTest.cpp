#include <gmock/gmock.h>
#include <sys/un.h>

#include <memory>
#include <thread>

#include "client/ReportingClient.h"
#include "tests/client/FakeService.h"

namespace vx {

TemporaryListener::TemporaryListener() {
  char folder[] = "/tmp/vx-client-XXXXXX";
  folder_ = mkdtemp(folder);
  path_ = folder_ + "/service.socket";
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path_.c_str(), path_.size() + 1);
  fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  EXPECT_EQ(bind(fd_, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  EXPECT_EQ(listen(fd_, 0), 0);
}

TemporaryListener::~TemporaryListener() {
  close(fd_);
  unlink(path_.c_str());
  rmdir(folder_.c_str());
}

namespace {

using testing::ElementsAre;
using testing::HasSubstr;
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
    const ClientStatus status = client->adopt(service.pair());
    ASSERT_TRUE(status.ok()) << status.text;
    service.read();  // the hello
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
  ASSERT_TRUE(client->adopt(service.pair()).ok());
  EXPECT_TRUE(client->sendMessageAsync(message(), kCategory, 1).ok());
  EXPECT_TRUE(client->sendMessageAsync(Payload(), 9, 0, {42, -1}).ok());
  EXPECT_TRUE(client->setServiceTypeAsync(7, 42, nullptr).ok());
  EXPECT_THAT(service.read(), ElementsAre(Bytes{0x82, 0x00, 0x01}))
      << "calls are gathered, not written one by one";
  EXPECT_TRUE(client->wantsWrite());
  EXPECT_TRUE(client->process().ok());
  EXPECT_THAT(service.read(),
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
  service.write(errorFrame(1, 8, "dropped"));
  service.write(trueReply(2));
  EXPECT_TRUE(client->process().ok());
  EXPECT_THAT(outcomes, ElementsAre("ok", "dropped", "ok"));
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
  service.write(trueReply(1));
  client->process();
  EXPECT_TRUE(ended);
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
  service.write(errorFrame(-1, 10, "replies were not read for too long"));
  service.close();
  while (client->process().ok()) {
  }
  EXPECT_THAT(outcomes, testing::Each(HasSubstr("not read for too long")));
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
  options.maxBufferedBytes = 64 << 10;
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
  std::size_t arrived = service.read().size();
  EXPECT_TRUE(create(1).ok()) << "the socket has room again";
  while (client->wantsWrite()) {
    ASSERT_TRUE(client->process().ok());
    arrived += service.read().size();
  }
  EXPECT_EQ(arrived, taken + 1);
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
    while (frames < 2) frames += service.read().size();
    service.write(trueReply(1));
    service.close();
  });
  EXPECT_TRUE(client->goodbye().ok());
  daemon.join();
  EXPECT_THAT(outcomes, ElementsAre("ok"));
  EXPECT_EQ(create(2).code, Code::NotConnected);
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
