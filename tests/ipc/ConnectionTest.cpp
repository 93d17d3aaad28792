#include <gmock/gmock.h>
#include <sys/socket.h>

#include <memory>
#include <set>
#include <thread>

#include "platform/linux/execution/SystemThreading.h"
#include "platform/linux/ipc/SocketConnection.h"
#include "tests/fakes/FakePlatform.h"
#include "tests/ipc/TestInterface.h"
#include "tests/wire/SocketEnd.h"

namespace vx::lnx {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::SizeIs;

const std::string kTestHello =
    "0 1 {interface=Test,max_frame_bytes=1048576,max_calls_in_flight=1024,"
    "max_unread_reply_bytes=262144,max_sessions=1024}";

// One connection on a real loop, with a host of which the test is the other half. Time is the
// test's.
class ConnectionTest : public testing::Test, public ConnectionHost {
 protected:
  ConnectionTest() {
    executor_.adoptInteractiveThread();
    loop_.addPassEndHook([this] {
      const auto flushing = std::move(toFlush_);
      toFlush_.clear();
      for (const auto& c : flushing) c->flush();
    });
  }
  ~ConnectionTest() override {
    object->kept.clear();
    if (connection) connection->shutDownNow();
    peer.close();
    run();
    connection.reset();
    executor_.stop(Monotonic::max());
  }

  void accept() {
    events.clear();
    object = std::make_shared<TestObject>();
    connection = std::make_shared<SocketConnection>(*this, peer.pair(), 200, 501);
    connection->setExportedInterface(testInterface());
    connection->setExportedObject(object);
    connection->setInterruptionHandler([this] { events.emplace_back("interrupted"); });
    connection->setInvalidationHandler([this] { events.emplace_back("invalidated"); });
    connection->resume();
  }
  // With the hello through.
  void connect() {
    accept();
    send(clientHello());
    ASSERT_THAT(peer.texts(), SizeIs(1));
  }
  void pass() { loop_.runOnce(Monotonic{}); }
  void run() {
    for (int i = 0; i < 12; ++i) pass();
  }
  void send(const Bytes& bytes) {
    peer.write(bytes);
    run();
  }
  void call(uint64_t number, int operation, int64_t argument = 0) {
    send(callFrame(number, operation, argument));
  }
  // `count` echoes, numbered on from `first`.
  static Bytes echoes(int count, int first = 1) {
    Bytes out;
    for (int i = first; i < first + count; ++i) out = out + callFrame(uint64_t(i), kEcho, i);
    return out;
  }
  static void list(Bytes& out, uint64_t number) {
    out = out + callFrame(number, kList, 0, [](CborWriter&) {});
  }
  std::vector<std::string> answers() { return peer.texts(); }
  bool closed() const { return closes == 1; }

  // ConnectionHost
  EventLoop& loop() override { return loop_; }
  Executor& executor() override { return executor_; }
  Clock& clock() override { return platform.clock; }
  const ListenerOptions& limits() const override { return options; }
  ListenerCounters& counters() override { return counted; }
  wire::ReadBuffers& readBuffers() override { return buffers_; }
  bool readingPaused() override { return congested; }
  void waitForReading(const std::shared_ptr<SocketConnection>&) override { ++waits; }
  void flushAtPassEnd(const std::shared_ptr<SocketConnection>& c) override {
    toFlush_.push_back(c);
  }
  void unreadChanged(SocketConnection&, bool unread) override { unreadSays = unread; }
  void closed(SocketConnection&) override { ++closes; }

  fakes::FakePlatform platform;
  ListenerOptions options;
  ListenerCounters counted;
  bool congested = false;
  bool unreadSays = false;
  int waits = 0;
  int closes = 0;
  SocketEnd peer;
  std::shared_ptr<TestObject> object = std::make_shared<TestObject>();
  std::shared_ptr<SocketConnection> connection;
  std::vector<std::string> events;

 private:
  SystemClock steady_;
  Executor executor_;
  EventLoop loop_{executor_, steady_};
  wire::ReadBuffers buffers_;
  std::vector<std::shared_ptr<SocketConnection>> toFlush_;
};

TEST_F(ConnectionTest, CallsRunWhereverTheStreamIsCut) {
  const Bytes stream =
      clientHello() + callFrame(1, kEcho, 300) + callFrame(2, kTake, 4, [](CborWriter& w) {
        w.integer(7);
        w.integer(8);
        w.null();
        w.null();
      });
  for (std::size_t cut = 0; cut <= stream.size(); ++cut) {
    accept();
    const auto at = stream.begin() + static_cast<std::ptrdiff_t>(cut);
    send(Bytes(stream.begin(), at));
    send(Bytes(at, stream.end()));
    EXPECT_THAT(object->calls, ElementsAre("echo 300", "take 7 8"));
    EXPECT_THAT(answers(), ElementsAre(kTestHello, "2 1 1", "2 2 null")) << cut;
  }
  EXPECT_EQ(counted.calls, 2 * (stream.size() + 1));
}

TEST_F(ConnectionTest, TheFirstFrameIsAHelloOfThisVersion) {
  const struct {
    Bytes first;
    const char* answer;
  } cases[] = {{callFrame(1, kEcho, 1), "3 null 1"},
               {goodbyeFrame(), "3 null 1"},
               {Bytes{3, 0, 0, 0, 0x82, 0, 2}, "3 null 7"},
               {Bytes{2, 0, 0, 0, 0x81, 0}, "3 null 7"}};
  for (const auto& c : cases) {
    accept();
    send(c.first + callFrame(2, kEcho, 2));
    EXPECT_THAT(answers(), ElementsAre(c.answer));
    EXPECT_TRUE(peer.ended());
    EXPECT_THAT(events, ElementsAre("interrupted", "invalidated"));
    EXPECT_THAT(object->calls, IsEmpty());
  }
  EXPECT_EQ(counted.unsupportedVersions, 2U);
  EXPECT_EQ(counted.malformedFrames, 2U);
  connect();
  send(clientHello());
  EXPECT_THAT(answers(), IsEmpty()) << "a second hello is ignored";
}

TEST_F(ConnectionTest, FramesUpToTheLimit) {
  options.maxFrameBytes = 200;
  const auto sized = [](std::size_t bytes) {  // the body of such a call
    return callFrame(1, kTake, 4, [&](CborWriter& w) {
      w.integer(1);
      w.integer(1);
      w.encoded(PayloadBuilder().set("k", std::string(bytes - 12, 'x')).build().encoded());
      w.null();
    });
  };
  for (const std::size_t bytes : {199U, 200U, 201U}) {
    connect();
    ASSERT_EQ(sized(bytes).size(), bytes + wire::kLengthBytes);
    send(sized(bytes));
    EXPECT_THAT(answers(), ElementsAre(bytes <= 200 ? "2 1 null" : "3 null 2")) << bytes;
    EXPECT_EQ(peer.ended(), bytes > 200);
  }
  EXPECT_EQ(counted.oversizedFrames, 1U);
  connect();
  object->list.assign(300, 1);
  send([] {
    Bytes out;
    list(out, 5);
    return out;
  }());
  EXPECT_THAT(answers(), ElementsAre("3 5 2"));
  call(6, kEcho);
  EXPECT_THAT(answers(), ElementsAre("2 6 1")) << "an answer too large is that call's affair";
  EXPECT_EQ(counted.oversizedReplies, 1U);
}

TEST_F(ConnectionTest, WrongCallsAreAnsweredAndDoNothing) {
  connect();
  const auto take = [&](int64_t type, int64_t category, const Bytes& dictionary,
                        const Bytes& numbers) {
    send(callFrame(1, kTake, 4, [&](CborWriter& w) {
      w.integer(type);
      w.integer(category);
      w.encoded(dictionary);
      w.encoded(numbers);
    }));
    return answers();
  };
  const Bytes none{0xf6};
  const Bytes empty{0xa0};
  EXPECT_THAT(take(65535, 0xFFFFFFFF, {0xa1, 0x61, 'a', 1}, {0x82, 1, 0x20}),
              ElementsAre("2 1 null"));
  EXPECT_THAT(take(65536, 1, none, none), ElementsAre("3 1 4"));
  EXPECT_THAT(take(-1, 1, none, none), ElementsAre("3 1 4"));
  EXPECT_THAT(take(1, int64_t{1} << 32, none, none), ElementsAre("3 1 4"));
  EXPECT_THAT(take(1, 1, {0x80}, none), ElementsAre("3 1 4"));
  EXPECT_THAT(take(1, 1, empty, empty), ElementsAre("3 1 4"));
  EXPECT_THAT(take(1, 1, empty, {0x82, 0x61, 'x', 1}), ElementsAre("3 1 4"));
  EXPECT_THAT(object->calls, ElementsAre("take 65535 4294967295 {a=1} [1 -1 ]"));
  send(callFrame(2, kEcho, 2, [](CborWriter& w) { w.integer(1), w.integer(2); }));
  call(3, 0);
  call(4, kMessage + 1);
  send(callFrame(5, kMessage, 1, [](CborWriter& w) { w.null(); }));
  send(callFrame(6, kMessage, 1, [](CborWriter& w) { w.encoded(Bytes{0xa1, 0x61, 'a', 1}); }));
  EXPECT_THAT(answers(), ElementsAre("3 2 4", "3 3 3", "3 4 3", "3 5 4", "2 6 {a=1}"));
  EXPECT_EQ(counted.wrongArguments, 8U);
  EXPECT_EQ(counted.unknownOperations, 2U);
  send({5, 0, 0, 0, 0x84, 1, 0x20, 1, 1});  // a call whose number is negative
  EXPECT_THAT(answers(), ElementsAre("3 null 1"));
  EXPECT_EQ(counted.calls, 13U);
}

TEST_F(ConnectionTest, ResourcesOfOnePeerAreLimited) {
  options.maxSessionsPerConnection = 2;
  connect();
  for (const int64_t id : {1, 2, 2, 3}) call(1, kAcquire, id);
  call(1, kRelease, 1);
  call(1, kAcquire, 3);
  EXPECT_THAT(answers(), ElementsAre("2 1 1", "2 1 1", "2 1 1", "3 1 5", "2 1 1", "2 1 1"));
  EXPECT_EQ(counted.tooManySessions, 1U);
}

TEST_F(ConnectionTest, ReadsNoMoreWhileTooManyCallsAreUnanswered) {
  options.maxCallsInFlight = 2;
  connect();
  call(1, kHold);  // held answers do not count
  call(2, kKeep);
  EXPECT_EQ(counted.readingPauses, 0U);
  call(3, kKeep);
  EXPECT_EQ(counted.readingPauses, 1U);
  send(echoes(3, 4));
  EXPECT_THAT(object->calls, SizeIs(3));
  object->kept[1](true);
  run();
  EXPECT_THAT(object->calls, SizeIs(6));
  EXPECT_THAT(answers(), ElementsAre("2 2 1", "2 4 1", "2 5 1", "2 6 1"));
}

TEST_F(ConnectionTest, CallsReadAlreadyWaitWithTheOthers) {
  options.maxCallsInFlight = 2;
  connect();
  Bytes six;
  for (int i = 1; i <= 6; ++i) six = six + callFrame(uint64_t(i), kKeep, i);
  send(six + Bytes{7, 0, 0});
  EXPECT_THAT(object->calls, SizeIs(2));
  for (std::size_t i = 0; i < 6; ++i) {
    object->kept[i](true);
    run();
    EXPECT_EQ(object->calls.size(), std::min<std::size_t>(i + 3, 6));
  }
  send(Bytes{0, 0x84, 1, 7, kEcho, 0x19, 1, 1});
  EXPECT_EQ(object->calls.back(), "echo 257");
}

TEST_F(ConnectionTest, ReadsNoMoreAtTheLimitOfUnreadReplies) {
  constexpr uint32_t kReply = 8;
  for (const int replies : {9, 10, 11}) {
    options.maxUnreadReplyBytes = 10 * kReply;
    connect();
    counted.readingPauses = 0;
    peer.write(echoes(replies));
    pass();
    pass();
    EXPECT_EQ(counted.readingPauses, replies < 10 ? 0U : 1U);
    EXPECT_EQ(object->calls.size(), static_cast<std::size_t>(std::min(replies, 10)));
    run();
    EXPECT_THAT(answers(), SizeIs(static_cast<std::size_t>(replies)));
  }
}

TEST_F(ConnectionTest, APeerThatReadsSlowlyGetsEveryByteOnceAndInOrder) {
  connect();
  const int small = 2304;  // the least that the kernel grants
  setsockopt(peer.fd(), SOL_SOCKET, SO_RCVBUF, &small, sizeof small);
  object->list.assign(20000, 1);
  options.maxUnreadReplyBytes = 300000;
  Bytes calls;
  for (uint64_t i = 1; i <= 40; ++i) list(calls, i);
  send(calls);
  const std::size_t before = object->calls.size();
  EXPECT_LT(before, 40U) << "reading pauses";
  EXPECT_TRUE(unreadSays);
  std::vector<std::string> got;
  for (int i = 0; got.size() < 40 && i < 20000; ++i) {
    peer.readSome(1000);
    pass();
    if (i % 100 == 0)
      for (std::string& text : answers()) got.push_back(text.substr(0, 8));
  }
  ASSERT_EQ(got.size(), 40U);
  for (std::size_t i = 0; i < got.size(); ++i)
    EXPECT_THAT(got[i], HasSubstr("2 " + std::to_string(i + 1) + " ("));
  EXPECT_FALSE(unreadSays);
  EXPECT_EQ(connection->stallDeadline(), std::nullopt);
}

TEST_F(ConnectionTest, APeerThatReadsNothingMoreIsCut) {
  connect();
  object->list.assign(1000000, 1);
  Bytes calls;
  list(calls, 1);
  EXPECT_EQ(connection->stallDeadline(), std::nullopt);
  send(calls);
  const Monotonic start = platform.clock.monotonic();
  EXPECT_EQ(connection->stallDeadline(), start + std::chrono::seconds(10));
  platform.clock.advance(std::chrono::seconds(3));
  run();
  EXPECT_EQ(connection->stallDeadline(), start + std::chrono::seconds(10));
  while (peer.readSome(10000) > 0 && connection->stallDeadline() < start + std::chrono::seconds(13))
    pass();
  EXPECT_EQ(connection->stallDeadline(), start + std::chrono::seconds(13)) << "progress counts";
  connection->cutStalled();
  run();
  EXPECT_TRUE(closed());
  EXPECT_FALSE(unreadSays);
  EXPECT_THAT(events, ElementsAre("interrupted", "invalidated"));
  EXPECT_EQ(counted.slowClientsCut, 1U);

  options.maxUnreadReplyBytes = 2 << 20;  // the goodbye is read, and the end waits for the reply
  connect();
  object->list.assign(1000000, 1);
  send(calls + goodbyeFrame());
  EXPECT_TRUE(unreadSays);
  connection->cutStalled();
  EXPECT_FALSE(unreadSays);
  EXPECT_EQ(closes, 2);
}

TEST_F(ConnectionTest, OneReadMayTakeSeveralTurns) {
  connect();
  send(echoes(600));
  EXPECT_THAT(answers(), SizeIs(600));
}

TEST_F(ConnectionTest, RepliesMadeLaterOvershootTheirLimitByOneTurn) {
  options.maxUnreadReplyBytes = 100;
  connect();
  object->later = executor().makeSerial("later", QualityOfService::UserInteractive);
  object->list.assign(10, 1);
  Bytes lists;
  for (uint64_t i = 1; i <= 10; ++i) list(lists, i);
  for (const auto& [calls, turn] : {std::pair(echoes(600), 512U), std::pair(lists, 8U)}) {
    object->calls.clear();
    peer.write(calls);
    pass();
    pass();
    EXPECT_EQ(object->calls.size(), turn);
    run();
  }
  EXPECT_THAT(answers(), SizeIs(610));
}

TEST_F(ConnectionTest, CongestionHoldsFramesBack) {
  connect();
  congested = true;
  send(echoes(2));
  send(echoes(2, 3));
  EXPECT_THAT(object->calls, IsEmpty());
  EXPECT_EQ(waits, 1);
  congested = false;
  connection->continueReading();
  run();
  EXPECT_THAT(answers(), ElementsAre("2 1 1", "2 2 1", "2 3 1", "2 4 1"));
}

TEST_F(ConnectionTest, AGoodbyeLetsCallsEndFirst) {
  connect();
  call(1, kHold);
  call(2, kKeep);
  send(echoes(1, 3) + goodbyeFrame() + echoes(1, 4));
  EXPECT_THAT(events, ElementsAre("invalidated"));
  EXPECT_THAT(answers(), ElementsAre("2 3 1"));
  EXPECT_FALSE(peer.ended());
  EXPECT_EQ(connection->exportedObject(), nullptr);
  object->kept[1](true);
  run();
  EXPECT_THAT(answers(), ElementsAre("2 2 1"));
  EXPECT_TRUE(peer.ended()) << "held answers are not waited for";
  EXPECT_TRUE(closed());
  EXPECT_THAT(object->calls, SizeIs(3));
}

TEST_F(ConnectionTest, AnAbruptEndIsAnInterruptionAfterTheLastWholeFrame) {
  connect();
  call(1, kKeep);
  peer.write(echoes(2, 2) + Bytes{5, 0, 0, 0, 0x84});
  peer.close();
  run();
  EXPECT_THAT(object->calls, ElementsAre("keep 0", "echo 2", "echo 3"));
  EXPECT_THAT(events, ElementsAre("interrupted", "invalidated"));
  object->kept[0](true);  // nobody is there
  object->kept.clear();
  run();
  EXPECT_TRUE(closed());
  EXPECT_EQ(counted.abandonedCalls, 0U);
}

TEST_F(ConnectionTest, ACallLetGoIsAnsweredWithAnError) {
  options.maxCallsInFlight = 1;
  connect();
  call(1, kKeep);
  send(echoes(1, 2));
  object->kept.clear();
  run();
  EXPECT_THAT(answers(), ElementsAre("3 1 8", "2 2 1"));
  options.maxCallsInFlight = 2;
  call(3, kHold);
  call(4, kKeep);
  send(goodbyeFrame());
  for (const bool last : {false, true}) {
    object->kept.erase(object->kept.begin());
    run();
    EXPECT_THAT(answers(), IsEmpty()) << "not after the goodbye";
    EXPECT_EQ(peer.ended(), last);
  }
  EXPECT_EQ(counted.abandonedCalls, 1U);
}

TEST_F(ConnectionTest, RepliesComeFromAnyThreadAndOnce) {
  connect();
  call(1, kKeep);
  call(2, kKeep);
  call(3, kKeep);
  object->kept[2](true);
  std::thread([this] {
    object->kept[0](std::vector<int64_t>{4, 5});
    object->kept[0](true);
    object->kept.clear();  // and lets the others go
  }).join();
  run();
  EXPECT_THAT(answers(), ElementsAre("2 3 1", "2 1 (4,5)", "3 2 8"));
  EXPECT_EQ(counted.secondReplies, 1U);
  EXPECT_EQ(counted.abandonedCalls, 1U);
  call(4, kKeep);  // takes a place that was left
  call(5, kKeep);
  object->kept[1](uint16_t{9});
  object->kept[0](Error{"d", -2, "why"});
  run();
  EXPECT_THAT(answers(), ElementsAre("2 5 9", "2 4 {domain=d,code=-2,reason=why}"));
}

TEST_F(ConnectionTest, RepliesMayOutliveTheConnection) {
  connect();
  call(1, kKeep);
  call(2, kKeep);
  const Reply late = std::move(object->kept[0]);
  peer.close();
  connection->shutDownNow();
  run();
  late(true);
  connection.reset();
  run();
  late(true);
  object->kept[1](true);
}

TEST_F(ConnectionTest, ShutDownRunsWhatHasArrived) {
  connect();
  call(1, kHold);
  peer.write(echoes(700, 2) + Bytes{5, 0, 0, 0, 0x84});
  connection->shutDown();
  run();
  EXPECT_THAT(object->calls, SizeIs(701));
  EXPECT_THAT(events, ElementsAre("invalidated"));
  const std::vector<std::string> got = answers();
  ASSERT_THAT(got, SizeIs(701));
  EXPECT_EQ(got[699], "2 701 1");
  EXPECT_EQ(got[700], "4");
  EXPECT_TRUE(peer.ended());
  EXPECT_EQ(closes, 1);
}

TEST_F(ConnectionTest, ShutDownWaitsForRoomUntilTimeRunsOut) {
  options.maxCallsInFlight = 1;
  connect();
  call(1, kKeep);
  peer.write(echoes(1, 2));
  connection->shutDown();
  run();
  EXPECT_THAT(events, IsEmpty());
  object->kept[0](true);
  while (events.empty()) loop().runOnce(SystemClock().monotonic() + std::chrono::milliseconds(5));
  run();
  EXPECT_THAT(answers(), ElementsAre("2 1 1", "2 2 1", "4"));

  connect();
  call(1, kKeep);
  connection->shutDown();
  connection->shutDownNow();
  run();
  EXPECT_THAT(answers(), ElementsAre("4"));
  EXPECT_THAT(events, ElementsAre("invalidated"));
}

TEST_F(ConnectionTest, CountersAreNamed) {
  counted.accepted = 3;
  counted.readingPauses = 9;
  EXPECT_THAT(counted.text(), testing::MatchesRegex("accepted=3 calls=0 .* reading_pauses=9"));
}

}  // namespace
}  // namespace vx::lnx
