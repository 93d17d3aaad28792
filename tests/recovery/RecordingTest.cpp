#include <gmock/gmock.h>
#include <sys/un.h>

#include <cstring>
#include <filesystem>
#include <fstream>
#include <future>

#include "Statistics/VXReportingProcessState.h"
#include "platform/linux/execution/SteppedWork.h"
#include "platform/linux/recovery/Records.h"
#include "tests/ipc/IpcTest.h"
#include "tests/journal/JournalFixture.h"
#include "tests/recovery/RecordedService.h"
#include "tests/wire/SocketEnd.h"
#include "wire/Operations.h"

namespace vx::lnx {
namespace {

using testing::Contains;
using testing::StartsWith;
using wire::Operation;

class RecordingTest : public JournalFixture {
 protected:
  RecordingTest() { open(); }
  ~RecordingTest() override { stop(); }

  void serve() {
    service = std::make_unique<RecordedService>(journal.get());
    service->fakes.services.processNames = {{getpid(), "recording"}};
    if (whileSettingUp) {  // with nobody to relay to
      service->executor.setRelayUnrecorded();
      service->fakes.vyr.toRows = [this, add = service->fakes.vyr.toRows](std::string text,
                                                                          const Payload& payload) {
        if (text.starts_with("session")) whileSettingUp();
        return add(std::move(text), payload);
      };
    }
    recorder.emplace(*journal, service->fakes.clock);
    recorder->setUnrecordedHandler([this](const Status&) { ++timesTold; });
    service->listener.setRecorder(*recorder);
    const Status opened = service->listener.open(root);
    ASSERT_TRUE(opened.ok()) << opened.text();
    std::promise<void> listening;
    service->listener.setHooks({.congested = [](uid_t) { return false; },
                                .listening = [&] { listening.set_value(); },
                                .stopping = [] {}});
    service->listener.setDelegate(service->delegate);
    thread_ = std::thread([this] { service->listener.resume(); });
    listening.get_future().wait();
  }
  // Work that is not due is dropped.
  void stop() {
    clients.clear();
    if (thread_.joinable()) {
      service->loop.stop();
      thread_.join();
      service->runQueues();
    }
  }
  std::size_t connect() {
    UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, (root + "/service.socket").c_str(), sizeof address.sun_path - 1);
    EXPECT_EQ(::connect(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    clients.push_back(std::make_unique<SocketEnd>(std::move(socket)));
    clients.back()->write(frame(0, 1));
    answer(clients.size() - 1);
    return clients.size() - 1;
  }
  std::string answer(std::size_t client) {
    for (;;) {
      for (const std::string& said : clients[client]->texts())
        if (!said.starts_with("2 2 ")) return said;
      clients[client]->await();
    }
  }
  template <class... Arguments>
  std::string call(std::size_t client, Operation operation, const Arguments&... arguments) {
    clients[client]->write(frame(1, 1, operation, arguments...));
    return answer(client);
  }
  void create(std::size_t client, int64_t id, uint16_t type = 7) {
    call(client, Operation::CreateReportingSession, id);
    call(client, Operation::SetServiceType, type, id);
  }
  // Without identifiers to all that are started.
  void send(std::size_t client, int64_t number, const std::vector<int64_t>& ids = {}) {
    const Payload message = dictionary(number, 50);
    EXPECT_EQ(call(client, Operation::SendMessage, message.encoded(), 3, 4, listOf(ids)),
              "2 1 null");
  }
  // Is answered by the stop.
  void start(std::size_t client, int64_t id) {
    clients[client]->write(frame(1, 2, Operation::StartReportingSessionForID, id));
    call(client, Operation::ReporterID, id);
  }
  // Until the service has let go of what a client held that has left.
  void awaitReporters(std::size_t client, const std::string& reporters) {
    while (call(client, Operation::GetAllReporters) != "2 1 " + reporters) continue;
  }
  bool done(uint64_t number) {
    for (const auto& record : read().records)
      if (record.call == number) return record.done;
    ADD_FAILURE() << "no call " << number;
    return false;
  }
  // "5 @1 Call sendMessage {..} 3 4 null": number, connection, kind and what is in it.
  static std::string textOf(const JournalContents::Record& record) {
    static constexpr const char* kNames[] = {"",
                                             "Accepted",
                                             "Call",
                                             "StopCall",
                                             "DestroyCall",
                                             "EndedInterrupted",
                                             "EndedOrderly",
                                             "EndedServiceStopped",
                                             "EndedCrashed",
                                             "PreferencesChanged"};
    std::string text = std::to_string(record.call) + " @" + std::to_string(connectionOf(record)) +
                       " " + kNames[record.kind];
    if (const auto client = readAccepted(record.head))
      if (record.kind == static_cast<uint8_t>(RecordKind::Accepted))
        return text + (client->pid == getpid() && client->uid == getuid() ? " own" : " foreign");
    if (record.kind == static_cast<uint8_t>(RecordKind::PreferencesChanged))
      return text + " " + std::string(record.head.begin(), record.head.end());
    if (record.head.empty()) return text;
    const Frame frame = Frame::decode(record.head).value();
    auto call = readCall(record.head, record.dictionary, vxReportingServiceInterface());
    text += " " + std::string(call.value().operation->name);
    for (std::size_t i = 3; i < frame.size(); ++i)
      text += " " + (frame[i].kind() == ValueKind::Null ? "null" : frame[i].text());
    if (record.dictionary) text += " " + record.dictionary->text();
    return text;
  }
  std::vector<std::string> recorded() {
    std::vector<std::string> texts;
    for (const auto& record : read().records) texts.push_back(textOf(record));
    return texts;
  }

  std::unique_ptr<RecordedService> service;
  std::optional<JournalRecorder> recorder;
  std::vector<std::unique_ptr<SocketEnd>> clients;
  std::function<void()> whileSettingUp;
  int timesTold = 0;

 private:
  std::thread thread_;
};

TEST_F(RecordingTest, WhatReachesTheServiceIsInTheJournalInItsOrder) {
  serve();
  const std::size_t a = connect();
  const std::size_t b = connect();
  create(a, 11, 7);
  call(b, Operation::CreateReportingSession, 22);
  call(a, Operation::ReporterID, 11);          // a question
  call(a, Operation::CreateReportingSession);  // refused
  call(a, Operation::SetConfiguration, nullptr, 11);
  send(a, 5, {11});
  call(a, Operation::StopReportingSessionForID, 11);
  call(a, Operation::DestroyReportingSession, 11);
  clients[b]->close();
  awaitReporters(a, "()");
  const std::size_t c = connect();
  clients[a]->write(frame(4));
  while (!clients[a]->ended()) (void)clients[a]->texts();
  (void)c;
  {
    const SocketEnd stays = std::move(*clients[c]);
    stop();
  }
  EXPECT_THAT(
      recorded(),
      ElementsAre("1 @1 Accepted own", "2 @2 Accepted own", "3 @1 Call createReportingSession 11",
                  "4 @1 Call setServiceType 7 11", "5 @2 Call createReportingSession 22",
                  "6 @1 Call setConfiguration null 11",
                  "7 @1 Call sendMessage {} 3 4 (11) {n=5,text=" + std::string(50, 't') + "}",
                  "8 @1 StopCall stopReportingSessionForID 11",
                  "9 @1 DestroyCall destroyReportingSession 11", "10 @2 EndedInterrupted",
                  "11 @11 Accepted own", "12 @1 EndedOrderly", "13 @11 EndedServiceStopped"));
  const auto contents = read();
  for (const auto& record : contents.records)
    EXPECT_DOUBLE_EQ(record.time, 365 * 50 * 86400.0) << record.call;
  const auto& notes = contents.records[0].notes;
  ASSERT_THAT(notes, SizeIs(1)) << "what the service asks of the client belongs to its record";
  EXPECT_EQ(readInput(notes[0].bytes)->answer.text(), "{process name=recording}");
  EXPECT_THAT(service->rows.texts(), Contains(StartsWith("10:"))) << "as what an end writes";
  EXPECT_EQ(recorder->preferencesChanged("some.name").call(), 14u);
  EXPECT_EQ(recorded().back(), "14 @0 PreferencesChanged some.name");
  service->fakes.clock.advance(std::chrono::seconds(1));
  EXPECT_DOUBLE_EQ(recorder->preferencesChanged("").time(), 365 * 50 * 86400.0);
  recorder->endPass();  // the time is asked for once a pass
  EXPECT_DOUBLE_EQ(recorder->preferencesChanged("").time(), 365 * 50 * 86400.0 + 1);
}

bool liesIn(const std::string& folder, const void* place) {
  std::ifstream maps("/proc/self/maps");
  for (std::string line; std::getline(maps, line);) {
    uintptr_t begin = 0;
    uintptr_t end = 0;
    const auto at = reinterpret_cast<uintptr_t>(place);
    if (line.find(folder) != std::string::npos &&
        std::sscanf(line.c_str(), "%lx-%lx", &begin, &end) == 2 && at >= begin && at < end)
      return true;
  }
  return false;
}

TEST_F(RecordingTest, MessagesTravelWhereTheyWereRecordedAndOnTheHeapWhenTheJournalIsFull) {
  options.maxBytes = 4 * kSegmentBytes;
  open();
  serve();
  const std::size_t a = connect();
  const auto isInJournal = [&](std::size_t client) {
    send(client, 1);
    EXPECT_TRUE(service->executor.drain(Monotonic::max()));
    const bool lies = liesIn(options.folder, service->rows.places("one-off {").at(0));
    service->rows.commit();
    return lies;
  };
  EXPECT_TRUE(isInJournal(a));
  while (append(1, dictionary(0, 9000)).ok() || append(1, dictionary(0)).ok() ||
         journal->append({.kind = 1}).ok()) {
  }
  EXPECT_FALSE(isInJournal(a));
  EXPECT_FALSE(isInJournal(a));
  const std::size_t late = connect();
  EXPECT_FALSE(isInJournal(late));
  EXPECT_EQ(timesTold, 3);
  ASSERT_TRUE(journal->beginGeneration().ok() && journal->endSnapshot().ok());
  EXPECT_TRUE(isInJournal(a));
  // Without its beginning a connection could not be replayed: it stays out, its end as well.
  EXPECT_FALSE(isInJournal(late));
  stop();
  EXPECT_EQ(recorder->counters().unrecorded, 3u);
  EXPECT_THAT(recorded(), ElementsAre(HasSubstr("sendMessage"), HasSubstr("@1 Ended")));
}

TEST_F(RecordingTest, ACallIsDoneWhenItsRowsAreAndNotBefore) {
  const VXReportingProcessState processState;
  serve();
  const std::size_t a = connect();
  create(a, 1);
  start(a, 1);
  send(a, 1, {1});  // call 5
  create(a, 2, 4);  // 6, 7: alarms, whose standalone messages wait
  service->fakes.services.random = 59;
  send(a, 2, {2});  // 8
  call(a, Operation::ReporterID, 1);
  ASSERT_TRUE(service->executor.drain(Monotonic::max()));
  EXPECT_TRUE(done(2));
  EXPECT_FALSE(done(5));
  EXPECT_FALSE(journal->allDone());
  service->rows.commit();
  EXPECT_TRUE(done(5));
  EXPECT_TRUE(done(8)) << "what waits has a record of its own";
  stop();
  service->rows.commit();
  service.reset();
  EXPECT_FALSE(journal->allDone());
}

TEST_F(RecordingTest, MemoryIsGivenBackForNoCallsSakeAndDroppedWorkLeavesItsCallUndone) {
  auto own = std::make_unique<RecordedService>(journal.get());
  {
    const Cause cause{append(1, dictionary(1))->ticket, {}};
    const CauseScope scope(cause);
    own->threading.memoryWasFreed(64 << 20);  // in two seconds
    own->executor.background().async([] {});
    ASSERT_TRUE(own->executor.drain(Monotonic::max()));
    EXPECT_FALSE(journal->allDone());
  }
  EXPECT_TRUE(journal->allDone());
  {
    const Cause cause{append(1, dictionary(2))->ticket, {}};
    const CauseScope scope(cause);
    own->executor.background().asyncAfter(std::chrono::hours(1), [] {});
  }
  own.reset();
  EXPECT_FALSE(journal->allDone()) << "work that was dropped is not done";
  own = std::make_unique<RecordedService>(journal.get());
  const uint64_t inSteps = append(1, dictionary(3))->call;
  {
    const Cause cause{append(1, dictionary(4))->ticket, {}};
    const CauseScope scope(cause);
    own->executor.setStepsTaker([](auto) {});  // drops them
    serviceQueue()->asyncInSteps([] { return true; });
  }
  own->runQueues();
  EXPECT_TRUE(done(inSteps));
  EXPECT_FALSE(done(inSteps + 1)) << "nor are steps";
}

TEST_F(RecordingTest, CallsAreServedBetweenTheStepsOfLongWorkAndAStopDoesTheRest) {
  serve();
  const std::size_t a = connect();
  std::atomic<int> left = 300;
  service->executor.makeSerial("long", QualityOfService::UserInteractive)->asyncInSteps([&] {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
    return --left > 0;
  });
  for (const int before = left; left == before;) std::this_thread::yield();
  call(a, Operation::ReporterID, 1);
  EXPECT_GT(left, 0);
  stop();
  EXPECT_EQ(left, 0);
}

TEST_F(RecordingTest, ARelayThatReachesNobodyKeepsNothingInTheJournal) {
  const VXReportingProcessState processState;
  std::promise<void> setUp;
  whileSettingUp = [over = setUp.get_future().share()] { over.wait(); };
  serve();
  const std::size_t a = connect();
  create(a, 1);
  start(a, 1);      // call 4
  send(a, 1, {1});  // 5
  service->rows.commit();
  EXPECT_TRUE(done(4) && done(5)) << "although the set-up waits";
  setUp.set_value();
  ASSERT_TRUE(service->executor.drain(Monotonic::max()));
  EXPECT_FALSE(liesIn(options.folder, service->rows.places("message 1 ").at(0)));
}

TEST(JournalSharesTest, WhoeverHasMoreThanHisShareIsOverItUntilASnapshotIsComplete) {
  JournalShares shares(1000);
  shares.add(1, 1500);
  EXPECT_FALSE(shares.isOver(1)) << "nobody else is there";
  shares.add(2, 500);
  EXPECT_TRUE(shares.isOver(1));
  EXPECT_FALSE(shares.isOver(2)) << "an equal share";
  shares.add(2, 1);
  EXPECT_TRUE(shares.isOver(2));
  shares.generationBegan();
  shares.add(2, 600);
  shares.add(3, 400);
  EXPECT_TRUE(shares.isOver(1)) << "what was before still counts";
  shares.snapshotCompleted();
  EXPECT_FALSE(shares.isCrowded());
  shares.add(3, 1);
  EXPECT_TRUE(shares.isOver(2));
  EXPECT_FALSE(shares.isOver(3) || shares.isOver(1));
}

// What a journal of another version, or by somebody else, may hold.
TEST(Records, ThatCannotBeBelievedAreNoCallsAndNoInputs) {
  const auto text = [](const Bytes& head) {
    return readCall(head, std::nullopt, vxReportingServiceInterface()).status().text();
  };
  EXPECT_THAT(text({0x83, 1, 0}), HasSubstr("no frame"));
  EXPECT_THAT(text({0x82, 1, 0}), HasSubstr("no operation"));
  EXPECT_THAT(text({0x83, 1, 0, 0}), HasSubstr("no operation 0"));
  EXPECT_THAT(text({0x83, 1, 0, 12}), HasSubstr("no operation 12"));
  EXPECT_THAT(text({0x83, 1, 0, 1}), HasSubstr("takes 1 arguments"));
  EXPECT_THAT(text({0x89, 1, 0, 1, 1, 1, 1, 1, 1, 1}), HasSubstr("no operation"));
  EXPECT_EQ(text({0x84, 1, 0, 1, 5}), "");
  EXPECT_FALSE(readAccepted(Bytes(7)) || readAccepted(Bytes(9)));
  const Bytes note = writeInput(7, "what", PayloadBuilder().set("n", 5).build());
  for (std::size_t n = 0; n < note.size(); ++n) {
    EXPECT_FALSE(readInput(std::span(note).first(n))) << n;
  }
}

}  // namespace
}  // namespace vx::lnx
