#include <algorithm>
#include <thread>
#include <utility>

#include "platform/linux/ipc/SocketConnection.h"
#include "tests/ipc/IpcTest.h"

namespace vx::lnx {
namespace {

using testing::SizeIs;

const std::string kTestHello =
    "0 1 {interface=Test,max_frame_bytes=1048576,max_calls_in_flight=1024,"
    "max_unread_reply_bytes=262144,max_sessions=1024,max_identifiers=4096}";

// One connection on a real loop, with a host of which the test is the other half. Time is the
// test's.
class ConnectionTest : public IpcTest, public TestHost {
 protected:
  ConnectionTest() : TestHost(*this, p.clock, options, congested) {}
  ~ConnectionTest() override {
    object->kept.clear();
    if (connection) connection->shutDownNow();
    peer.close();
    run();
    connection.reset();
  }

  void accept() {
    events.clear();
    object = std::make_shared<TestObject>();
    connection = std::make_shared<SocketConnection>(*this, peer.pair(), 200, 501, kUser);
    connection->setExportedInterface(testInterface());
    connection->setExportedObject(object);
    connection->setInterruptionHandler([this] { events.emplace_back("interrupted"); });
    connection->setInvalidationHandler([this] { events.emplace_back("invalidated"); });
    connection->resume();
  }
  void connect() {
    accept();
    ASSERT_THAT(ask(frame(0, 1)), SizeIs(1));
  }
  void send(const Bytes& bytes) {
    peer.write(bytes);
    run();
  }
  void call(int number, int operation) { send(frame(1, number, operation, 0)); }
  std::vector<std::string> answers() { return peer.texts(); }
  std::vector<std::string> ask(const Bytes& bytes) {
    send(bytes);
    return answers();
  }
  void answer(std::size_t kept) {
    object->kept[kept](true);
    run();
  }
  // Calls numbered from `first` to `last`.
  static Bytes calls(int operation, int first, int last) {
    Bytes out;
    for (int i = first; i <= last; ++i)
      out = out + (operation == kList ? frame(1, i, kList) : frame(1, i, operation, i));
    return out;
  }

  const UserIndex kUser = accounts_.enter(501).value();
  SocketEnd peer;
  std::shared_ptr<SocketConnection> connection;
  std::vector<std::string> events;
};

TEST_F(ConnectionTest, CallsRunWhereverTheStreamIsCut) {
  const Bytes stream =
      frame(0, 1) + frame(1, 1, kEcho, 300) + frame(1, 2, kTake, 7, 8, nullptr, nullptr);
  for (std::size_t cut = 0; cut <= stream.size(); ++cut) {
    accept();
    const auto at = stream.begin() + static_cast<std::ptrdiff_t>(cut);
    send(Bytes(stream.begin(), at));
    EXPECT_THAT(ask(Bytes(at, stream.end())), ElementsAre(kTestHello, "2 1 1", "2 2 null")) << cut;
    EXPECT_THAT(object->calls, ElementsAre("echo 300", "take 7 8"));
  }
  EXPECT_EQ(counted.calls, 2 * (stream.size() + 1));
}

TEST_F(ConnectionTest, TheFirstFrameIsAHelloOfThisVersion) {
  const std::pair<Bytes, const char*> cases[] = {{frame(1, 1, kEcho, 1), "3 null 1"},
                                                 {frame(4), "3 null 1"},
                                                 {frame(0, 2), "3 null 7"},
                                                 {frame(0), "3 null 7"}};
  for (const auto& [first, answer] : cases) {
    accept();
    EXPECT_THAT(ask(first + frame(1, 2, kEcho, 2)), ElementsAre(answer));
    EXPECT_TRUE(peer.ended());
    EXPECT_THAT(events, ElementsAre("interrupted", "invalidated"));
    EXPECT_THAT(object->calls, IsEmpty());
  }
  EXPECT_EQ(counted.unsupportedVersions, 2U);
  EXPECT_EQ(counted.malformedFrames, 2U);
  connect();
  for (const Bytes& second : {frame(0, 1), frame(0, 2), frame(0)})
    EXPECT_THAT(ask(second + frame(1, 1, kEcho, 1)), ElementsAre("2 1 1")) << "ignored";
}

TEST_F(ConnectionTest, FramesUpToTheLimit) {
  options.maxFrameBytes = 200;
  for (const std::size_t bytes : {199U, 200U, 201U}) {
    connect();
    const Payload filling = PayloadBuilder().set("k", std::string(bytes - 12, 'x')).build();
    const Bytes sent = frame(1, 1, kTake, 1, 1, filling.encoded(), nullptr);
    ASSERT_EQ(sent.size(), bytes + wire::kLengthBytes);
    EXPECT_THAT(ask(sent), ElementsAre(bytes <= 200 ? "2 1 null" : "3 null 2")) << bytes;
    EXPECT_EQ(peer.ended(), bytes > 200);
  }
  EXPECT_EQ(counted.oversizedFrames, 1U);
  connect();
  object->list.assign(300, 1);
  EXPECT_THAT(ask(calls(kList, 5, 5) + calls(kEcho, 6, 6)), ElementsAre("3 5 2", "2 6 1"))
      << "an answer too large is that call's affair";
  EXPECT_EQ(counted.oversizedReplies, 1U);
}

TEST_F(ConnectionTest, WrongCallsAreAnsweredAndDoNothing) {
  options.maxSessionsPerConnection = 2;
  options.maxIdentifiers = 2;
  connect();
  const Bytes entry{0xa1, 0x61, 'a', 1};
  const Bytes empty{0xa0};
  const std::pair<Bytes, const char*> cases[] = {
      {frame(1, 1, kTake, 65535, 0xFFFFFFFF, entry, Bytes{0x82, 1, 0x20}), "2 1 null"},
      {frame(1, 1, kTake, 1, 1, nullptr, Bytes{0x83, 1, 1, 1}), "3 1 11"},
      {frame(1, 1, kTake, 65536, 1, nullptr, nullptr), "3 1 4"},
      {frame(1, 1, kTake, -1, 1, nullptr, nullptr), "3 1 4"},
      {frame(1, 1, kTake, 1, int64_t{1} << 32, nullptr, nullptr), "3 1 4"},
      {frame(1, 1, kTake, 1, 1, Bytes{0x80}, nullptr), "3 1 4"},
      {frame(1, 1, kTake, 1, 1, empty, empty), "3 1 4"},
      {frame(1, 1, kTake, 1, 1, empty, Bytes{0x82, 0x61, 'x', 1}), "3 1 4"},
      {frame(1, 1, kEcho, 1, 2), "3 1 4"},
      {frame(1, 1, 0, 0), "3 1 3"},
      {frame(1, 1, kEnd + 1, 0), "3 1 3"},
      {frame(1, 1, Bytes{0x1b, 0x80, 0, 0, 0, 0, 0, 0, 0}, 0), "3 1 3"},
      {frame(1, 1, kMessage, nullptr), "3 1 4"},
      {frame(1, 1, kMessage, entry), "2 1 {a=1}"},
      {frame(1, 1, kAcquire, 1), "2 1 1"},
      {frame(1, 1, kAcquire, 2), "2 1 1"},
      {frame(1, 1, kAcquire, 2), "2 1 1"},
      {frame(1, 1, kAcquire, 3), "3 1 5"},
      {frame(1, 1, kRelease, 1), "2 1 1"},
      {frame(1, 1, kAcquire, 3), "2 1 1"},
      {frame(1, -2, kEcho, 1), "3 null 1"}};
  for (const auto& [sent, answer] : cases)
    EXPECT_THAT(ask(sent), ElementsAre(answer)) << testing::PrintToString(sent);
  EXPECT_THAT(object->calls, ElementsAre("take 65535 4294967295 {a=1} 1 -1", "echo 1", "echo 2",
                                         "echo 2", "echo 1", "echo 3"));
  EXPECT_EQ(counted.wrongArguments, 8U);
  EXPECT_EQ(counted.unknownOperations, 3U);
  EXPECT_EQ(counted.tooManySessions, 1U);
  EXPECT_EQ(counted.tooManyIdentifiers, 1U);
  EXPECT_EQ(counted.calls, 21U);
}

TEST_F(ConnectionTest, WhoMayCallAPrivilegedOperationIsConfigured) {
  for (const bool allowed : {false, true}) {
    if (allowed) options.killAllowedUsers.push_back(501);
    connect();
    EXPECT_EQ(ask(frame(1, 1, kEnd)).empty(), allowed);
    EXPECT_EQ(object->calls.size(), allowed ? 1U : 0U);
    EXPECT_EQ(counted.notPermitted, 1U);
    object->kept.clear();
  }
}

TEST_F(ConnectionTest, ReadsNoMoreWhileTooManyCallsAreUnanswered) {
  options.maxCallsInFlight = 2;
  connect();
  call(1, kHold);  // held answers do not count
  call(2, kKeep);
  EXPECT_EQ(counted.readingPauses, 0U);
  call(3, kKeep);
  EXPECT_EQ(counted.readingPauses, 1U);
  send(calls(kKeep, 4, 7) + Bytes{7, 0, 0});
  for (std::size_t i = 1; i < 7; ++i) {
    EXPECT_EQ(object->calls.size(), std::min<std::size_t>(i + 2, 7));
    answer(i);
  }
  EXPECT_THAT(answers(), SizeIs(6));
  EXPECT_THAT(ask(Bytes{0, 0x84, 1, 8, kEcho, 0x19, 1, 1}), ElementsAre("2 8 1"));
  EXPECT_EQ(object->calls.back(), "echo 257");
}

TEST_F(ConnectionTest, ReadsNoMoreAtTheLimitOfUnreadReplies) {
  for (const int replies : {9, 10, 11}) {
    options.maxUnreadReplyBytes = 10 * 8;  // bytes of one
    connect();
    counted.readingPauses = 0;
    peer.write(calls(kEcho, 1, replies));
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
  send(calls(kList, 1, 40));
  EXPECT_LT(object->calls.size(), 40U) << "reading pauses";
  EXPECT_TRUE(unreadSays);
  std::vector<std::string> got;
  for (int i = 0; got.size() < 40 && i < 20000; ++i) {
    peer.readSome(1000);
    pass();
    if (i % 100 == 0)
      for (const std::string& text : answers()) got.push_back(text);
  }
  ASSERT_EQ(got.size(), 40U);
  for (std::size_t i = 0; i < got.size(); ++i)
    EXPECT_THAT(got[i], testing::StartsWith("2 " + std::to_string(i + 1) + " ("));
  EXPECT_FALSE(unreadSays);
  EXPECT_EQ(connection->stallDeadline(), std::nullopt);
}

TEST_F(ConnectionTest, APeerThatReadsNothingMoreIsCut) {
  using std::chrono::seconds;
  connect();
  object->list.assign(1000000, 1);
  EXPECT_EQ(connection->stallDeadline(), std::nullopt);
  send(calls(kList, 1, 1));
  const Monotonic start = p.clock.monotonic();
  p.clock.advance(seconds(3));
  run();
  EXPECT_EQ(connection->stallDeadline(), start + seconds(10));
  while (peer.readSome(10000) > 0 && connection->stallDeadline() < start + seconds(13)) pass();
  EXPECT_EQ(connection->stallDeadline(), start + seconds(13)) << "progress counts";
  connection->cutStalled();
  run();
  EXPECT_EQ(closes, 1);
  EXPECT_FALSE(unreadSays);
  EXPECT_THAT(events, ElementsAre("interrupted", "invalidated"));
  EXPECT_EQ(counted.slowClientsCut, 1U);

  options.maxUnreadReplyBytes = 2 << 20;  // the goodbye is read, and the end waits for the reply
  connect();
  object->list.assign(1000000, 1);
  send(calls(kList, 1, 1) + frame(4));
  EXPECT_TRUE(unreadSays);
  connection->cutStalled();
  EXPECT_FALSE(unreadSays);
  EXPECT_EQ(closes, 2);
}

TEST_F(ConnectionTest, RepliesMadeLaterOvershootTheirLimitByOneStep) {
  options.maxUnreadReplyBytes = 100;
  connect();
  object->later = executor().makeSerial("later", QualityOfService::UserInteractive);
  object->list.assign(10, 1);
  for (const auto& [sent, step] :
       {std::pair(calls(kEcho, 1, 60), 16U), std::pair(calls(kList, 1, 10), 6U)}) {
    object->calls.clear();
    peer.write(sent);
    pass();
    pass();
    EXPECT_EQ(object->calls.size(), step);
    run();
  }
  EXPECT_THAT(answers(), SizeIs(70));
}

TEST_F(ConnectionTest, WhatThereIsNoMemoryForIsRefusedOrGivenUp) {
  connect();
  object->hasMemory = false;
  EXPECT_THAT(ask(calls(kKeep, 1, 1) + calls(kEcho, 2, 2)), ElementsAre("3 1 8", "2 2 1"));
  EXPECT_EQ(counted.callsGivenUp, 1U);
  accounts_.add(kUser, MemoryKind::Kept, MemoryLimits().maxUserBytes + 1);
  EXPECT_THAT(ask(calls(kAcquire, 3, 3) + calls(kEcho, 4, 4)), ElementsAre("3 3 9", "2 4 1"));
  accounts_.remove(kUser, MemoryKind::Kept, MemoryLimits().maxUserBytes + 1);
  accounts_.add(kUser, MemoryKind::Waiting, 1 << 20);
  EXPECT_THAT(ask(calls(kAcquire, 5, 5)), ElementsAre("2 5 1"));
  EXPECT_EQ(counted.tooMuchMemory, 1U);
}

TEST_F(ConnectionTest, LargeFramesAndUnreadRepliesWaitWhileTheUserHoldsTooMuchOfThem) {
  connect();
  const std::size_t most = MemoryLimits().maxUserWaitingBytes;
  const Payload dictionary = PayloadBuilder().set("k", std::string(300 << 10, 'x')).build();
  const Bytes large = frame(1, 1, kMessage, dictionary.encoded());
  accounts_.add(kUser, MemoryKind::Frames, most);
  const auto middle = large.begin() + (150 << 10);
  peer.write({large.begin(), middle});
  runUntil([&] { return waits > 0; });
  EXPECT_THAT(object->calls, IsEmpty());
  accounts_.remove(kUser, MemoryKind::Frames, most);
  connection->continueReading();
  run();
  EXPECT_GE(accounts_.bytes(kUser, MemoryKind::Frames), 300 << 10)
      << "the whole frame, not what has come";
  peer.write({middle, large.end()});
  runUntil([&] { return accounts_.bytes(kUser, MemoryKind::Unread) > 0; });  // of its echo
  EXPECT_EQ(accounts_.bytes(kUser, MemoryKind::Frames), 0);

  accounts_.add(kUser, MemoryKind::Unread, most);
  send(calls(kEcho, 3, 40));
  EXPECT_THAT(object->calls, IsEmpty());
  runUntil([&] {
    (void)answers();
    return object->calls.size() == 38;
  });
  accounts_.remove(kUser, MemoryKind::Unread, most);
}

TEST_F(ConnectionTest, CongestionHoldsFramesBack) {
  connect();
  congested = true;
  send(calls(kEcho, 1, 2));
  send(calls(kEcho, 3, 600));  // more than one step takes
  EXPECT_THAT(object->calls, IsEmpty());
  EXPECT_EQ(waits, 1);
  congested = false;
  connection->continueReading();
  run();
  EXPECT_THAT(answers(), SizeIs(600));
}

TEST_F(ConnectionTest, AGoodbyeLetsCallsEndFirst) {
  connect();
  send(calls(kHold, 1, 2) + calls(kKeep, 3, 4));
  EXPECT_THAT(ask(calls(kEcho, 5, 5) + frame(4) + calls(kEcho, 6, 6)), ElementsAre("2 5 1"));
  EXPECT_THAT(object->calls, SizeIs(5));
  EXPECT_THAT(events, ElementsAre("invalidated"));
  EXPECT_EQ(connection->exportedObject(), nullptr);
  answer(2);
  EXPECT_THAT(answers(), ElementsAre("2 3 1"));
  object->kept.erase(object->kept.begin());
  run();
  EXPECT_FALSE(peer.ended());
  object->kept.pop_back();
  EXPECT_THAT(ask({}), IsEmpty()) << "no error after the goodbye";
  EXPECT_TRUE(peer.ended()) << "held answers are not waited for";
  EXPECT_EQ(closes, 1);
  EXPECT_EQ(counted.abandonedCalls, 0U);
}

TEST_F(ConnectionTest, AnAbruptEndIsAnInterruptionAfterTheLastWholeFrame) {
  connect();
  call(1, kKeep);
  peer.write(calls(kEcho, 2, 3) + Bytes{5, 0, 0, 0, 0x84});
  peer.close();
  run();
  EXPECT_THAT(object->calls, ElementsAre("keep", "echo 2", "echo 3"));
  EXPECT_THAT(events, ElementsAre("interrupted", "invalidated"));
  answer(0);  // nobody is there
  object->kept.clear();
  run();
  EXPECT_EQ(closes, 1);
  EXPECT_EQ(counted.abandonedCalls, 0U);
}

TEST_F(ConnectionTest, APeerThatOnlyReadsGetsItsAnswersAfterTheInterruption) {
  connect();
  send(calls(kHold, 1, 1) + calls(kKeep, 2, 2));
  shutdown(peer.fd(), SHUT_WR);
  run();
  EXPECT_THAT(answers(), IsEmpty());
  EXPECT_THAT(events, ElementsAre("interrupted", "invalidated"));
  EXPECT_FALSE(peer.ended());
  answer(1);
  EXPECT_THAT(answers(), ElementsAre("2 2 1"));
  EXPECT_TRUE(peer.ended()) << "held answers are not waited for";
}

TEST_F(ConnectionTest, APeerThatDiesWhileItsRepliesWaitIsNoticed) {
  options.maxUnreadReplyBytes = 10 * 8;  // bytes of one
  connect();
  peer.write(calls(kEcho, 1, 25));
  peer.close();
  run();
  EXPECT_THAT(object->calls, SizeIs(25)) << "what it sent runs";
  EXPECT_THAT(events, ElementsAre("interrupted", "invalidated"));
  EXPECT_EQ(closes, 1);
}

TEST_F(ConnectionTest, EveryCallIsAnsweredOnceFromAnyThread) {
  options.maxCallsInFlight = 3;
  connect();
  send(calls(kKeep, 1, 3));
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
  send(calls(kKeep, 4, 6));  // these take places that were left
  ASSERT_THAT(object->kept, SizeIs(3));
  object->kept[1](uint16_t{9});
  object->kept[0](Error{"d", -2, "why"});
  run();
  EXPECT_THAT(answers(), ElementsAre("2 5 9", "2 4 {domain=d,code=-2,reason=why}"));
  peer.close();
  connection->shutDownNow();
  run();
  answer(2);
  connection.reset();
  answer(2);
}

TEST_F(ConnectionTest, ShutDownRunsWhatHasArrived) {
  connect();
  call(1, kHold);
  peer.write(calls(kEcho, 2, 701) + Bytes{5, 0, 0, 0, 0x84});
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

TEST_F(ConnectionTest, ShutDownWaitsForAnswersUntilTimeRunsOut) {
  options.maxCallsInFlight = 1;
  connect();
  send(calls(kKeep, 1, 1) + calls(kEcho, 2, 2));
  connection->shutDown();
  run();
  EXPECT_THAT(events, IsEmpty());
  answer(0);
  runUntil([&] { return !events.empty(); });
  run();
  EXPECT_THAT(answers(), ElementsAre("2 1 1", "2 2 1", "4"));

  connect();
  call(1, kKeep);
  connection->shutDown();
  connection->shutDownNow();
  run();
  EXPECT_THAT(answers(), ElementsAre("4"));
  EXPECT_THAT(events, ElementsAre("invalidated"));

  connection = std::make_shared<SocketConnection>(*this, peer.pair(), 200, 501, kServiceItself);
  connection->shutDown();  // before it was let in
  EXPECT_THAT(ask({}), ElementsAre("4"));
}

}  // namespace
}  // namespace vx::lnx
