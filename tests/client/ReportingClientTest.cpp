#include <gmock/gmock.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <cmath>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <thread>

#include "client/RealtimeReporter.h"
#include "client/ReportingClient.h"
#include "tests/wire/SocketEnd.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

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
  std::vector<std::string> expected;
  for (int64_t number = 200; number > 1; --number) {
    service.write(yes(number));
    expected.push_back(std::to_string(number) + " ok");
  }
  expected.emplace_back("1 dropped");
  EXPECT_TRUE(receive(yes(200) + frame(3, 1, 8, "dropped")).ok());
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
    if (answered) receive(yes(990) + yes(995) + yes(995) + yes(1) + yes(1));
    EXPECT_EQ(client->pendingCalls(), answered ? 9U : 11U);
    service.close();
    EXPECT_EQ(client->process().code, Code::Disconnected);
    EXPECT_THAT(told, ElementsAre(answered ? Code::Ok : Code::Disconnected));
    EXPECT_EQ(outcomes.size(), 999U);
    EXPECT_EQ(client->unknownAnswers(), answered ? 3U : 0U);
    EXPECT_EQ(client->pendingCalls(), 0U);
  }
}

// An answer of another kind refuses that call alone.
TEST_F(ReportingClientTest, EveryBlockingFormMakesItsCallAndReadsItsAnswer) {
  connect();
  const auto said = [](const ClientStatus& status, const std::string& value = "ok") {
    return status.ok() ? value : status.code == Code::Refused ? "refused" : status.text;
  };
  const auto shown = [&](const auto& r) { return said(r.status, testing::PrintToString(r.value)); };
  const auto create = [&] { return shown(client->createReportingSession(-7)); };
  const auto type = [&] { return shown(client->getServiceType(7)); };
  const auto all = [&] { return shown(client->getAllReporters()); };
  const auto send = [&] { return said(client->sendMessage(message, kCategory, 6)); };
  const auto validate = [&] {
    const auto r = client->validateReporter(7);
    return said(r.status, std::to_string(r.value.reporterID * 10 + r.value.serviceType));
  };
  const Payload valid = PayloadBuilder().set("reporterID", 7).set("serviceType", 9).build();
  const Payload error =
      PayloadBuilder().set("code", 9).set("domain", "d").set("reason", "why").build();
  const auto bytes = [](const Payload& p) { return Bytes(p.encoded().begin(), p.encoded().end()); };
  const std::string sent = " 6 {gain=0.5,on=1} 134217733 6 null";
  const struct {
    Bytes answer;
    std::function<std::string()> call;
    std::string outcome, frame;
  } cases[] = {
      {{0xf5}, create, "true", " 1 -7"},
      {{0x61, 'x'}, create, "refused", " 1 -7"},
      {{0xf5}, [&] { return shown(client->setServiceType(65535, 7)); }, "true", " 2 65535 7"},
      {{0x19, 0xff, 0xfe}, type, "65534", " 3 7"},
      {{0x1a, 0, 1, 0, 0}, type, "refused", " 3 7"},
      {{0x20}, type, "refused", " 3 7"},
      {{0xf5},
       [&] { return shown(client->setConfiguration(message, 7)); },
       "true",
       " 4 {gain=0.5,on=1} 7"},
      {{0xf6}, send, "ok", sent},
      {{0x61, 'x'}, send, "refused", sent},
      {bytes(error),
       [&] {
         return said(client->sendMessage(Payload(), 0xFFFFFFFF, 65535, {7, -1}));
       },
       "the service refused the message (d, code 9): why", " 6 {} 4294967295 65535 (7,-1)"},
      {{0xf4}, [&] { return shown(client->stopReportingSession(7)); }, "false", " 7 7"},
      {{0xf5}, [&] { return shown(client->destroyReportingSession(7)); }, "true", " 8 7"},
      {{0x82, 0x20, 0x18, 42}, all, "{ -1, 42 }", " 10"},
      {{0x81, 0x61, 'x'}, all, "refused", " 10"},
      {bytes(valid), validate, "79", " 9 7"},
      {{0xa0}, validate, "refused", " 9 7"}};
  int number = 0;
  for (const auto& [answer, call, outcome, arguments] : cases) {
    service.write(frame(2, ++number, answer));
    EXPECT_EQ(call(), outcome) << number;
    EXPECT_THAT(service.texts(), ElementsAre("1 " + std::to_string(number) + arguments));
  }
  service.write(frame(3, ++number, 5, "enough"));
  const ClientStatus refused = client->createReportingSession(1).status;
  EXPECT_EQ(refused.code, Code::Refused);
  EXPECT_EQ(refused.wireCode, 5);
  client->startReportingSession(7, nullptr);
  client->sendMessageAsync(Payload(), 1, 1, std::vector<int64_t>{});  // not the same as without
  service.write(frame(3, 20, 10, "not for you"));
  EXPECT_EQ(client->killService().text, "not for you");
  shutdown(service.fd(), SHUT_WR);
  EXPECT_TRUE(client->killService().ok());
  EXPECT_THAT(service.texts(),
              ElementsAre("1 17 1 1", "1 18 5 7", "1 19 6 {} 1 1 ()", "1 20 11", "1 21 11"));
  EXPECT_FALSE(client->killService().ok()) << "nobody was told";
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
  EXPECT_THAT(lone.connect(std::string(108, 'x')).text, HasSubstr("too long"));
  EXPECT_THAT(lone.connect(std::string(107, 'x')).text, HasSubstr("cannot connect to xx"));
  EXPECT_THAT(lone.reconnect().text, HasSubstr("cannot connect to xx"));
  for (const Bytes& half : {Bytes{5, 0}, Bytes()})
    EXPECT_EQ(lone.adopt(dial(service, half), kShort).code, Code::TimedOut);
  EXPECT_FALSE(lone.isConnected());
  service.texts();
  EXPECT_TRUE(service.ended()) << "the descriptor is given back";
  EXPECT_TRUE(lone.adopt(dial(service)).ok()) << "nothing is left of the one before";
}

TEST_F(ReportingClientTest, TheEndOfTheConnectionFailsEveryCallOnce) {
  const std::pair<Bytes, const char*> ends[] = {
      {{}, "the service went away"},
      {frame(3, nullptr, 1, "a frame was broken"), "a frame was broken"},
      {{0xFF, 0xFF, 0xFF, 0xFF}, "the service sent"},  // beyond every limit
      {{0, 0, 0, 0}, "the service sent"},              // an empty frame
      {frame(2, 1), "the service sent"},               // no value
      {frame(99, 1, true), "the service sent"},        // an unknown kind
      {frame("x", 1, true), "the service sent"},       // no integer
      {framed({0x80}), "the service sent"},            // no kind
      {hello(1), "the service sent"},                  // a second one
  };
  for (const auto& [bytes, why] : ends) {
    for (const bool writing : {false, true}) {  // into a socket without a reader
      connect({}, hello(1, uint64_t{1} << 40));
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

TEST_F(ReportingClientTest, BlockingFormsAndGoodbyeWaitForTheServiceAndNoLonger) {
  connect();
  const auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(client->getServiceType(7, kShort).status.code, Code::TimedOut);
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(10));
  service.write(frame(2, 1, 7) + frame(2, 2, 8));  // the first one comes too late
  EXPECT_EQ(client->getServiceType(7).value, 8);
  create(3, 3);
  service.write(yes(3));
  shutdown(service.fd(), SHUT_WR);
  EXPECT_TRUE(client->goodbye().ok());
  EXPECT_THAT(service.texts(), ElementsAre("1 1 3 7", "1 2 3 7", "1 3 1 3", "4"));
  EXPECT_THAT(outcomes, ElementsAre("3 ok"));
  EXPECT_EQ(create(4).code, Code::NotConnected);
  EXPECT_EQ(client->goodbye().code, Code::NotConnected);

  connect();
  create(3, 3);
  EXPECT_EQ(client->goodbye(kShort).code, Code::TimedOut);
  EXPECT_THAT(outcomes, ElementsAre("3 said goodbye"));
}

TEST_F(ReportingClientTest, ACallbackMayCallAndReadOnAndConnectAnew) {
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

  SocketEnd second;
  SocketEnd third;
  client->createReportingSessionAsync(5, [&](const auto& result) {
    outcomes.push_back(result.status.text);
    EXPECT_TRUE(client->adopt(dial(second)).ok());
  });
  create(6, 6);
  EXPECT_TRUE(client->adopt(dial(third)).ok());
  EXPECT_THAT(outcomes, ElementsAre("2 ok", "the connection was made anew", "6 " + outcomes[1]));
  EXPECT_THAT(third.texts(), IsEmpty());
  EXPECT_TRUE(third.ended()) << "the callback's connection stays";
  EXPECT_THAT(second.texts(), ElementsAre("0 1"));
  client->createReportingSessionAsync(  // numbering goes on
      7, [this](const auto&) { EXPECT_EQ(create(8).code, Code::NotConnected); });
  second.write(yes(7));
  EXPECT_EQ(client->goodbye(kShort).code, Code::TimedOut);
  EXPECT_THAT(second.texts(), ElementsAre("1 7 1 7", "4"));
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

TEST_F(ReportingClientTest, WhateverAServiceSaysEachCallIsAnsweredOnce) {
  int files = 0;
  for (const auto& entry : std::filesystem::directory_iterator(VX_FUZZ_CORPUS "/client")) {
    std::ifstream in(entry.path(), std::ios::binary);
    const Bytes bytes((std::istreambuf_iterator<char>(in)), {});
    EXPECT_EQ(LLVMFuzzerTestOneInput(bytes.data(), bytes.size()), 0);
    ++files;
  }
  EXPECT_GE(files, 20);
}

using Kind = RealtimeReporter::Kind;

TEST_F(ReportingClientTest, NumbersOfAnotherThreadArriveInOrderOrAreCounted) {
  RealtimeReporter reporter({{{"i", Kind::Integer}, {"half", Kind::Double}}, 1, 2, {{42}}}, 60);
  constexpr int kCount = 3000;
  int sent = 0;
  std::atomic<bool> done{false};
  EXPECT_TRUE(reporter.send({-1, 0}));
  EXPECT_EQ(reporter.process(*std::make_unique<ReportingClient>()).code, Code::NotConnected);
  connect();
  std::thread audio([&] {
    while (sent < kCount) sent += reporter.send({sent, sent / 2.0}) ? 1 : 0;
    done = true;
  });
  std::vector<std::string> arrived;
  for (bool last = false; !last;) {
    last = done;
    EXPECT_TRUE(reporter.process(*client).ok());
    EXPECT_TRUE(client->process().ok());
    for (std::string& text : service.texts()) arrived.push_back(std::move(text));
  }
  audio.join();
  ASSERT_EQ(arrived.size(), kCount + 1U);
  for (int i = 0; i <= kCount; ++i) {
    const Payload expected =
        PayloadBuilder().set("i", i - 1).set("half", i == 0 ? 0 : (i - 1) / 2.0).build();
    ASSERT_EQ(arrived[i], "1 " + std::to_string(i + 1) + " 6 " + expected.text() + " 1 2 (42)");
  }
  const uint64_t before = reporter.dropped();
  for (int i = 0; i < 66; ++i) EXPECT_EQ(reporter.send({i, i}), i < 64);
  EXPECT_FALSE(reporter.send({1}));
  EXPECT_EQ(reporter.dropped() - before, 2U);
  EXPECT_EQ(reporter.refused(), 1U);
}

TEST_F(ReportingClientTest, NumbersBecomeOfTheirKeysKinds) {
  connect();
  RealtimeReporter reporter(
      {{{"i", Kind::Integer}, {"d", Kind::Double}, {"b", Kind::Boolean}}, 1, 2, {}}, 8);
  EXPECT_TRUE(reporter.send({2.9, true, 7}));
  EXPECT_TRUE(reporter.send({-1e300, -3, 0.5}));
  EXPECT_TRUE(reporter.send({std::nan(""), 0.5F, 0.0}));
  EXPECT_TRUE(reporter.send({1e300, 1U, false}));
  EXPECT_TRUE(reporter.process(*client).ok());
  client->flush();
  EXPECT_THAT(service.texts(), ElementsAre("1 1 6 {i=2,d=1,b=1} 1 2 null",
                                           "1 2 6 {i=-9223372036854775808,d=-3,b=1} 1 2 null",
                                           "1 3 6 {i=0,d=0.5,b=0} 1 2 null",
                                           "1 4 6 {i=9223372036854775807,d=1,b=0} 1 2 null"));
}

// A service that comes and goes at one path. Its end of the connection is `service`.
class KeptSessionsTest : public ReportingClientTest {
 protected:
  KeptSessionsTest() {
    std::string folder = "/tmp/vxkeptXXXXXX";
    path = mkdtemp(folder.data()) + std::string("/s");
    makeClient(512);
  }
  ~KeptSessionsTest() override {
    client.reset();
    goAway();
    rmdir(path.substr(0, path.size() - 2).c_str());
  }
  void makeClient(std::size_t bufferedBytes) {
    ReportingClient::Options options;
    options.keepSessions = true;
    options.maxBufferedBytes = options.writeAtBytes = bufferedBytes;
    client = std::make_unique<ReportingClient>(options);
  }
  std::vector<std::string> readAll() {
    std::vector<std::string> all = service.texts();
    while (client->wantsWrite()) {
      EXPECT_TRUE(client->process().ok());
      for (std::string& text : service.texts()) all.push_back(std::move(text));
    }
    return all;
  }
  void listen() {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(static_cast<char*>(address.sun_path), sizeof address.sun_path - 1);
    listener.reset(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    ASSERT_EQ(bind(listener.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    ASSERT_EQ(::listen(listener.get(), 4), 0);
  }
  void accept() {
    service.take(UniqueFd(::accept(listener.get(), nullptr, nullptr)));
    EXPECT_THAT(service.texts(), ElementsAre("0 1")) << "nothing else before the service greets";
    service.write(hello(1));
    EXPECT_TRUE(client->process().ok());
    EXPECT_TRUE(client->isConnected());
  }
  void goAway() {
    service.close();
    listener.reset();
    unlink(path.c_str());
  }
  void comeBack() {
    listen();
    poll(nullptr, 0, static_cast<int>(client->retryIn().value_or(kShort).count()));
    EXPECT_TRUE(client->process().ok());
    accept();
  }
  void send(int i) {
    const Payload numbered = PayloadBuilder().set("i", i).build();
    EXPECT_TRUE(client->sendMessageAsync(numbered, 1, 1).ok());
  }

  std::string path;
  UniqueFd listener;
};

TEST_F(KeptSessionsTest, AreMadeAgainBeforeWhatWaited) {
  listen();
  EXPECT_EQ(client->connect(path, std::chrono::milliseconds(0)).code, Code::TimedOut);
  send(1);
  accept();
  EXPECT_THAT(service.texts(), ElementsAre("1 1 6 {i=1} 1 1 null"));
  std::vector<Code> stopped;
  create(7, 10);  // 2 to 5
  client->setServiceTypeAsync(2, 7, nullptr);
  client->setConfigurationAsync(PayloadBuilder().set("a", 1).build(), 8, nullptr);
  client->startReportingSession(8, [&](const auto& r) { stopped.push_back(r.status.code); });  // 8
  client->startReportingSession(7, nullptr);
  client->stopReportingSessionAsync(7, nullptr);
  client->destroyReportingSessionAsync(9, nullptr);
  client->setServiceTypeAsync(3, 7, nullptr);  // 12
  ASSERT_TRUE(client->flush().ok());
  EXPECT_TRUE(receive(yes(2) + frame(3, 5, 5, "too many") + frame(4)).ok());
  EXPECT_THAT(outcomes, ElementsAre("7 ok", "10 too many"));
  send(2);  // 13: the service is leaving
  EXPECT_TRUE(client->flush().ok());
  EXPECT_THAT(service.texts(), testing::SizeIs(11));
  create(11, 11);
  client->startReportingSession(11, nullptr);
  goAway();
  EXPECT_TRUE(client->process().ok());
  EXPECT_THAT(client->status().text, HasSubstr("the service ended"));
  EXPECT_THAT(outcomes, testing::SizeIs(4)) << "8 and 9 were not answered";
  send(3);
  EXPECT_TRUE(client->process().ok());
  EXPECT_GT(client->retryIn(), std::chrono::milliseconds(0)) << "it is not there yet";

  comeBack();
  const std::string again = "1 46116860184273879";
  const std::vector<std::string> restored = {again + "04 1 7", again + "05 2 3 7", again + "07 1 8",
                                             again + "09 4 {a=1} 8", "1 8 5 8"};
  std::vector<std::string> expected = restored;
  for (const char* waited :
       {"1 13 6 {i=2} 1 1 null", "1 14 1 11", "1 15 5 11", "1 16 6 {i=3} 1 1 null"})
    expected.emplace_back(waited);
  EXPECT_EQ(service.texts(), expected);
  goAway();
  EXPECT_TRUE(client->process().ok());
  comeBack();
  expected = restored;
  expected.push_back(again + "10 1 11");
  expected.emplace_back("1 15 5 11");
  EXPECT_EQ(service.texts(), expected) << "messages are not sent again";
  EXPECT_TRUE(receive(frame(3, 1LL << 62, 5, "no more") + yes((1LL << 62) + 1) + yes(8)).ok());
  EXPECT_THAT(stopped, ElementsAre(Code::Ok));
  EXPECT_EQ(client->unknownAnswers(), 0U);
  EXPECT_EQ(client->counters().reconnections, 2U);
  EXPECT_EQ(client->counters().sessionsNotRestored, 1U);
}

TEST_F(KeptSessionsTest, WhatIsBegunIsNotSentAgainAndWhatIsTooMuchIsCounted) {
  makeClient(600 << 10);  // more than a socket takes at once
  EXPECT_EQ(client->connect(path).code, Code::NotConnected);
  std::size_t taken = 0;
  while (client->sendMessageAsync(message, kCategory, 1).ok()) ++taken;
  comeBack();
  const std::size_t first = service.texts().size();
  EXPECT_TRUE(service.holdsHalfAFrame());
  goAway();
  EXPECT_TRUE(client->process().ok());
  EXPECT_EQ(client->counters().unanswered, first + 1);
  comeBack();
  EXPECT_EQ(first + 1 + readAll().size(), taken);
  EXPECT_EQ(client->counters().dropped, 1U);
  create(2, 3);
  client->disconnect();
  EXPECT_EQ(client->counters().dropped, 3U);
  EXPECT_EQ(create(4).code, Code::NotConnected);
  EXPECT_FALSE(client->retryIn());
}

TEST_F(KeptSessionsTest, AreMadeAgainWhereThatWasCutShort) {
  makeClient(900 << 10);
  EXPECT_EQ(client->connect(path).code, Code::NotConnected);
  client->createReportingSessionAsync(1, nullptr);
  const Payload large = PayloadBuilder().set("x", std::string(600 << 10, 'x')).build();
  client->setConfigurationAsync(large, 1, nullptr);
  client->startReportingSession(1, nullptr);
  client->setServiceTypeAsync(7, 1, nullptr);
  comeBack();
  EXPECT_THAT(readAll(), testing::SizeIs(4));
  for (int i = 0; i < 2; ++i) {
    goAway();
    EXPECT_TRUE(client->process().ok());
    comeBack();
    EXPECT_TRUE(client->wantsWrite()) << "the socket is full";
  }
  const std::vector<std::string> texts = readAll();
  ASSERT_THAT(texts, testing::SizeIs(4));
  EXPECT_THAT(texts[1], testing::EndsWith(" 2 7 1"));
  EXPECT_EQ(texts[3], "1 3 5 1");
}

TEST_F(KeptSessionsTest, BlockingFormsWaitAcrossConnections) {
  EXPECT_EQ(client->connect(path).code, Code::NotConnected);
  EXPECT_THAT(client->createReportingSession(1, kShort).status.text, HasSubstr("cannot connect"));
  EXPECT_EQ(client->goodbye(kShort).code, Code::TimedOut);
  EXPECT_EQ(client->counters().dropped, 1U);
  EXPECT_EQ(client->goodbye().code, Code::NotConnected);
}

}  // namespace
}  // namespace vx
