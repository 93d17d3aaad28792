// What a process had accepted when it was killed, finished by the next one.
#include <gmock/gmock.h>

#include <filesystem>
#include <fstream>
#include <map>

#include "Statistics/VXReportingProcessState.h"
#include "platform/linux/execution/SteppedWork.h"
#include "platform/linux/ipc/ArgumentReading.h"
#include "platform/linux/recovery/JournalOpening.h"
#include "platform/linux/recovery/Records.h"
#include "platform/linux/recovery/Recovery.h"
#include "platform/linux/recovery/Snapshots.h"
#include "tests/ipc/IpcTest.h"
#include "tests/journal/JournalFixture.h"
#include "tests/recovery/RecordedService.h"
#include "wire/Operations.h"
#include "wire/Protocol.h"

namespace vx::lnx {
namespace {

using wire::Operation;

class RecoveryTest : public JournalFixture {
 protected:
  ~RecoveryTest() override { endLife(); }

  void beginLife() {
    auto opened = openJournal(options, root + "/moved");
    ASSERT_TRUE(opened.ok()) << opened.status().text();
    journal = std::move(opened->journal);
    left = std::move(opened->left);
    poisoned = opened->poisoned;
    complaints = opened->complaints;
    processState.emplace();
    service = std::make_unique<RecordedService>(journal.get(), &memory);
    service->fakes.services.processNames = {{200, "player"}, {201, "phone"}};
    service->fakes.services.internalBuild = true;
    service->fakes.services.random = 30;
    service->fakes.clock.wall = wall;
    service->fakes.clock.steady = service->steady.monotonic();
    service->executor.setStepsTaker([this](auto work) { steps.push_back(std::move(work)); });
    recorder.emplace(*journal, service->fakes.clock);
    snapshots.emplace(Snapshots::Means{
        .journal = *journal,
        .clock = service->fakes.clock,
        .save =
            [this](auto saved) {
              EXPECT_EQ(hooks, "began");
              return service->delegate->saveState(std::move(saved));
            },
        .connections =
            [this] {
              std::unordered_map<const ExportedObject*, RecordedConnection> all;
              for (const auto& [client, known] : connections) {
                const auto& [number, connection] = known;
                all[connection->object.get()] = {number, connection->processIdentifier(), 1000};
              }
              return all;
            },
        .crowded = [this] { return crowded; },
        .commitSoon = [this] { ++urged, service->rows.commit(); },
        .freed = [] {},
        .began = [this] { hooks = "began"; },
        .taken = [] {},
        .completed = [this] { hooks += std::to_string(snapshots->counters().completed); },
    });
  }
  void endLife() {
    steps.clear();
    recovery.reset();
    snapshots.reset();
    connections.clear();
    if (service != nullptr) {  // whose handlers hold sessions
      service->fakes.services.deviceHandlers.clear();
      service->fakes.services.interfaceHandlers.clear();
    }
    service.reset();
    processState.reset();
    journal.reset();
  }
  // Leaves the files as they are at this moment.
  void kill() {
    const std::string kept = root + "/kept";
    std::filesystem::rename(options.folder, kept);
    std::filesystem::copy(kept, options.folder);
    for (const auto& file : std::filesystem::directory_iterator(options.folder))
      std::filesystem::permissions(file, std::filesystem::perms(0600));
    std::filesystem::permissions(options.folder, std::filesystem::perms(0700));
    endLife();
    std::filesystem::remove_all(kept);
  }
  RecoveryOutcome recover(std::chrono::milliseconds later = {}) {
    wall += later;
    beginLife();
    service->fakes.services.processNames.clear();  // they are dead
    service->executor.setStepsTaker(nullptr);
    recovery.emplace(
        RecoveryMeans{service->fakes.installed, service->executor, *journal, {"test"}, {}},
        std::move(left));
    return recovery->run([] { return VXReportingServiceDelegate::create(); });
  }

  // --- what clients do ---
  void tick() {
    if (!steps.empty() && !steps.front()->runStep()) steps.pop_front();
    service->fakes.clock.wall = wall += std::chrono::milliseconds(10);
    recorder->endPass();
  }
  void connect(int client, int pid) {
    tick();
    const CallRecorder::Accepted accepted = recorder->accepted(pid, 1000);
    const Cause cause{accepted.ticket, {}};
    const CauseScope scope(cause);
    connections[client] = {accepted.connection, std::make_shared<fakes::FakeConnection>(pid)};
    service->delegate->listener(service->listener, connections[client].second);
    service->runQueues();
  }
  template <class... Values>
  void call(int client, Operation number, const Values&... values) {
    tick();
    const Bytes bytes = frame(1, 1, number, values...);
    const Frame frame = Frame::decode(std::span(bytes).subspan(wire::kLengthBytes)).value();
    const OperationDescription& operation =
        vxReportingServiceInterface().operations[static_cast<std::size_t>(number) - 1];
    CallArguments arguments;
    ASSERT_TRUE(readArguments(operation, frame, arguments).ok());
    const auto element = dictionaryElement(operation, frame);
    auto& [connection, of] = connections[client];
    CallRecorder::Called called = recorder->called(connection, frame, element);
    if (element) arguments.set(*element - wire::kCallHead, std::move(called.dictionary));
    const Cause cause{std::move(called.ticket), {}};
    const CauseScope scope(cause);
    operation.invoke(*of->object, arguments, Reply());
    service->runQueues();
  }
  void create(int client, int64_t id, uint16_t type) {
    call(client, Operation::CreateReportingSession, id);
    call(client, Operation::SetServiceType, type, id);
  }
  void start(int client, int64_t id) { call(client, Operation::StartReportingSessionForID, id); }
  void send(int client, int64_t number, const std::vector<int64_t>& ids = {}) {
    const Payload message = dictionary(number);
    call(client, Operation::SendMessage, message.encoded(), 5, 1, listOf(ids));
  }
  void prefer(const char* name, const char* disabled) {
    tick();
    service->fakes.services.preferences = {{"device_name", name}, {"disable_reporting", disabled}};
    const Cause cause{recorder->preferencesChanged("com.quorvel.sonik.reporting"), {}};
    const CauseScope scope(cause);
    serviceQueue()->async([handler = service->fakes.services.notifyHandler] {
      (*handler)(fakes::FakeServices::kToken);
    });
    service->runQueues();
  }
  void end(int client, CallRecorder::End how) {
    const Cause cause{recorder->ended(connections[client].first, how), {}};
    const CauseScope scope(cause);
    if (how == CallRecorder::End::Interrupted) connections[client].second->interruption();
    connections[client].second->invalidation();
    service->runQueues();
    connections.erase(client);
  }

  // What came before has been committed; what comes next belongs to a new generation.
  void beginSnapshot() {
    snapshots->demand();
    snapshots->afterPass();
    service->runQueues();
  }
  void snapshot() {
    const uint64_t before = snapshots->counters().completed;
    beginSnapshot();
    service->rows.commit();
    snapshots->afterPass();
    EXPECT_EQ(hooks, "began" + std::to_string(before + 1));
  }

  std::vector<std::string> written() {
    for (; !steps.empty(); steps.pop_front())
      while (steps.front()->runStep()) continue;
    service->runQueues();
    return service->rows.texts();
  }

  std::string hooks;  // that the snapshots called
  bool crowded = false;
  int urged = 0;
  std::deque<std::unique_ptr<SteppedWork>> steps;  // one is done with each tick
  Date wall{std::chrono::hours(24 * 365 * 50)};
  JournalContents left;
  std::vector<std::string> poisoned;
  fakes::FakeAggregateMemory memory;  // of all lives
  std::optional<VXReportingProcessState> processState;
  std::unique_ptr<RecordedService> service;
  std::optional<JournalRecorder> recorder;
  std::optional<Snapshots> snapshots;
  std::optional<Recovery> recovery;
  std::map<int, std::pair<uint64_t, std::shared_ptr<fakes::FakeConnection>>> connections;
};

// What a store has that writes no key twice; without the keys, which differ for ends.
std::vector<std::string> together(std::vector<std::string> some,
                                  const std::vector<std::string>& more) {
  some.insert(some.end(), more.begin(), more.end());
  std::ranges::sort(some);
  some.erase(std::ranges::unique(some).begin(), some.end());
  for (std::string& row : some) row.erase(0, row.find(' '));
  std::ranges::sort(some);
  return some;
}

enum class Cut : uint8_t { No, Begun, Whole };  // of the journal, in the middle

// Wherever a process is killed, and the next one as well: together they write what one would have
// that had lost its clients at that moment.
TEST_F(RecoveryTest, AKilledProcessLosesNothingAndWritesNothingTwice) {
  const Payload app = PayloadBuilder().set("HostApplicationDisplayID", "app").build();
  const std::vector<int64_t> both = {11, 22};
  using End = CallRecorder::End;
  const std::vector<std::function<void()>> script = {
      [&] { connect(1, 200); },
      [&] { send(1, 1); },  // nobody listens: a standalone
      [&] { create(1, 11, 7); },
      [&] { call(1, Operation::SetConfiguration, app.encoded(), 11); },
      [&] { start(1, 11); },
      [&] { connect(2, 201); },
      [&] { prefer("first", "false"); },
      [&] { create(2, 22, 3); },  // never started: needs no end
      [&] { connect(3, 202); },
      [&] { create(3, 44, 3), create(3, 55, 3), create(3, 66, 7); },
      [&] { start(3, 44), start(3, 55), start(3, 66), send(1, 9); },
      [&] { end(3, End::Orderly); },  // one session after the other, while others are served
      [&] { send(1, 2); },
      [&] { send(2, 3, both); },  // also to another client's
      [&] { create(2, 33, 3), start(2, 33); },
      [&] { memory.full = true, send(2, 4), memory.full = false; },  // no part of a summary
      [&] { prefer("second", "true"); },
      [&] { send(2, 5); },  // refused
      [&] { prefer("third", "false"); },
      [&] { call(2, Operation::StopReportingSessionForID, 33); },
      [&] { start(2, 33), send(2, 6); },
      [&] { create(2, 33, 3); },  // replaced without a stop: stays unended
      [&] { call(1, Operation::DestroyReportingSession, 11); },
      [&] { start(2, 33), send(1, 7); },
      [&] { end(2, End::Interrupted); },
  };
  const Date begin = wall;
  for (std::size_t steps = 1; steps <= script.size(); ++steps) {
    std::filesystem::remove_all(options.folder);
    wall = begin;
    beginLife();
    for (std::size_t i = 0; i < steps; ++i) script[i]();
    while (!connections.empty()) end(connections.begin()->first, End::Orderly);
    std::vector<std::string> names = written();
    const std::vector<std::string> whole = together(names, {});
    for (std::string& name : names) name.erase(name.find(' '));
    EXPECT_EQ(std::ranges::adjacent_find(names), names.end()) << "a name of two rows";
    const auto files = service->fakes.services.files;
    endLife();

    constexpr std::pair<int, Cut> kOthers[] = {
        {2, Cut::No}, {1, Cut::Begun}, {1, Cut::Whole}, {2, Cut::Whole}};
    for (const auto& [deaths, cut] : {std::pair(1, Cut::No), kOthers[steps % 4]}) {
      SCOPED_TRACE(std::to_string(deaths) + " deaths after " + std::to_string(steps) +
                   " steps, cut: " + std::to_string(static_cast<int>(cut)));
      std::filesystem::remove_all(options.folder);
      wall = begin;
      beginLife();
      const std::size_t middle = cut == Cut::Whole ? steps * 3 / 4 : steps / 2;
      for (std::size_t i = 0; i < middle; ++i) script[i]();
      std::vector<std::string> rows;
      if (cut == Cut::Begun) {
        const bool waits = !journal->allDone();
        beginSnapshot();
        snapshots->afterPass();
        EXPECT_EQ(snapshots->counters().completed, waits ? 0u : 1u);
      } else {
        rows = written();
        service->rows.commit();
      }
      if (cut == Cut::Whole) {
        snapshot();
        snapshot();
        for (const auto& record : read().records) EXPECT_EQ(record.type, EntryType::Snapshot);
      }
      auto filesNow = service->fakes.services.files;
      for (std::size_t i = middle; i < steps; ++i) script[i]();
      const std::size_t open = connections.size();
      for (const auto& [name, text] : service->fakes.services.files) filesNow[name] = text;
      kill();
      if (deaths == 2) {
        EXPECT_EQ(recover(std::chrono::hours(1)).ended, open);
        kill();
      }
      const RecoveryOutcome outcome = recover(std::chrono::hours(1));
      EXPECT_EQ(outcome.ended, deaths == 2 ? 0 : open);
      EXPECT_EQ(outcome.unreadable, 0u);
      EXPECT_EQ(together(rows, written()), whole);
      // A session's row is asked for, for its number.
      for (const std::string& row : written())
        EXPECT_TRUE(std::ranges::count(rows, row) == 0 || row.find(" session ") != row.npos) << row;
      for (const auto& [name, text] : service->fakes.services.files) filesNow[name] = text;
      EXPECT_EQ(filesNow, files);
      endLife();
    }
  }
}

TEST_F(RecoveryTest, WhoHasNoShareOfTheJournalLeftGetsASnapshotAsSoonAsItCanBe) {
  beginLife();
  connect(1, 200);
  create(1, 11, 3), start(1, 11), send(1, 1);
  JournalTicket late = recorder->preferencesChanged("of which a row comes late");
  snapshots->afterPass();
  EXPECT_FALSE(snapshots->isUnderWay());
  crowded = true;
  snapshots->afterPass();
  service->runQueues();
  EXPECT_TRUE(snapshots->isUnderWay());
  snapshots->afterPass();
  snapshots->afterPass();
  EXPECT_EQ(urged, 1) << "the store is asked to commit";
  snapshots->onDue();
  snapshots->afterPass();
  EXPECT_EQ(urged, 2) << "and again, for what has come to it since";
  late = {};
  snapshots->afterPass();
  EXPECT_EQ(hooks, "began1");
}

// Two lives in one journal: the second knows neither the clients nor the preferences of the first.
TEST_F(RecoveryTest, WhatALaterProcessAcceptedIsRunAgainAsItFoundThings) {
  beginLife();
  connect(1, 200);
  create(1, 11, 3);
  start(1, 11);
  prefer("first", "true");
  kill();
  recover();
  service->fakes.services.processNames = {{201, "phone"}};
  connect(2, 201);
  create(2, 11, 3);
  start(2, 11);
  service->rows.commit();
  send(2, 7);
  const std::vector<std::string> unwritten = written();
  EXPECT_THAT(unwritten, SizeIs(2));
  EXPECT_TRUE(connections[2].first > 1000) << "beyond all numbers of the first";
  kill();
  EXPECT_EQ(recover().undone, 1u);
  for (const std::string& row : unwritten) EXPECT_THAT(written(), ::testing::Contains(row));
  EXPECT_THAT(written(), SizeIs(7)) << "two sessions, a summary, a flush and an uptime";
}

TEST_F(RecoveryTest, AStandaloneWaitsForTheRestOfItsDelay) {
  std::vector<std::string> rows;  // of one that nothing disturbs
  for (const auto& [callDone, snapshotsTaken] :
       {std::pair(true, 0), {true, 0}, {false, 0}, {true, 1}, {true, 2}}) {
    std::filesystem::remove_all(options.folder);
    beginLife();
    connect(1, 200);
    create(1, 11, 4);
    send(1, 1, {11});
    if (callDone) service->rows.commit();
    if (rows.empty()) {
      processState->delayedMessages().sendAllFromNow();
      rows = written();
      EXPECT_THAT(rows, SizeIs(2));
      service->rows.commit();
      EXPECT_TRUE(journal->allDone());
      endLife();
      continue;
    }
    for (int i = 0; i < snapshotsTaken; ++i) snapshot();  // which do not wait for it
    kill();
    const int rest = snapshotsTaken > 0 ? 10000 : 4900;  // of 30 s: less than nothing, or a moment
    for (const auto& [later, sent, done] :
         {std::tuple{10000, 0, false}, {15000, 0, false}, {rest, 2, true}, {10000, 0, true}}) {
      EXPECT_EQ(recover(std::chrono::milliseconds(later)).unreadable, 0u);
      const Monotonic patience = service->steady.monotonic() + std::chrono::seconds(20);
      const auto ofTheDelayed = [&] {  // beside the event of a call that is not done
        const std::vector<std::string> now = written();
        return std::ranges::count_if(rows, [&](auto& row) { return std::ranges::count(now, row); });
      };
      while (ofTheDelayed() < sent && service->steady.monotonic() < patience)
        std::this_thread::yield();
      EXPECT_EQ(ofTheDelayed(), sent);
      EXPECT_EQ(service->rows.places("one-off").size(), static_cast<std::size_t>(sent));
      service->rows.commit();
      EXPECT_EQ(journal->allDone(), done);
      endReplay(options.folder);
      kill();
    }
  }
}

TEST_F(RecoveryTest, PartsOfASnapshotThatCannotBeBelievedAreLeftOut) {
  beginLife();
  connect(1, 200);
  create(1, 11, 3);
  start(1, 11);
  send(1, 1);
  snapshot();
  const JournalContents good = read();
  EXPECT_THAT(good.records, SizeIs(4));  // the service, a client, a session and its relay
  for (std::size_t damaged = 0; damaged < good.records.size(); ++damaged) {
    for (const bool cut : {true, false}) {
      service->rows.commit();
      ASSERT_TRUE(journal->beginGeneration().ok());
      for (std::size_t i = 0; i < good.records.size(); ++i) {
        const JournalContents::Record& record = good.records[i];
        Bytes head = record.head;
        if (i == damaged && cut) head.pop_back();
        if (i == damaged && !cut) head[head.size() / 2] ^= 0x15;
        EXPECT_TRUE(journal
                        ->appendToSnapshot({.kind = record.kind,
                                            .connection = record.connection,
                                            .head = head,
                                            .forEarlier = i == 3})
                        .ok());
      }
      EXPECT_TRUE(journal->endSnapshot().ok());
      kill();
      const RecoveryOutcome outcome = recover();
      if (cut) {
        EXPECT_GT(outcome.unreadable, 0u) << damaged;
      }
      EXPECT_EQ(outcome.ended, cut && damaged == 1 ? 0u : 1u);
      endReplay(options.folder);
    }
  }
}

TEST_F(RecoveryTest, AJournalWhoseReplaysDieIsMovedAsideAndTheServiceServes) {
  beginLife();
  connect(1, 200);
  const uint64_t first = connections[1].first;
  // So many processes end in their replay, after some of it; then there is another one.
  const auto replaysEnd = [&](int times, const std::function<void(const std::string&)>& after) {
    for (; times > 0; --times) {
      kill();
      beginLife();
      EXPECT_THAT(poisoned, IsEmpty());
      after(options.folder);
    }
    kill();
    beginLife();
  };
  replaysEnd(2, [&](const std::string&) { EXPECT_THAT(left.records, SizeIs(1)); });
  EXPECT_THAT(poisoned, ElementsAre(options.folder + ".aside-1"));
  EXPECT_THAT(left.records, IsEmpty());
  EXPECT_EQ(JournalReader::read(poisoned.at(0), kEpoch)->records.size(), 1u);
  connect(1, 200);
  EXPECT_GT(connections[1].first, first + 1);
  journal->discard();  // all is done: a later process finds nothing but what was moved aside
  endLife();
  beginLife();
  connect(1, 200);
  EXPECT_GT(connections[1].first, first + 1);
  kill();
  beginLife();
  EXPECT_THAT(poisoned, SizeIs(1));  // nobody was told
  told(poisoned);
  endReplay(options.folder);
  replaysEnd(8,
             replayServes);  // one that is cut short while clients are served counts as a quarter
  EXPECT_THAT(poisoned, SizeIs(1));
  told(poisoned);
  connect(1, 200);
  replaysEnd(4, endReplay);  // one that ends counts as none
  EXPECT_THAT(poisoned, IsEmpty());
}

TEST_F(RecoveryTest, WhatIsDamagedIsKeptAndTheRestIsRunAgain) {
  beginLife();
  connect(1, 200);
  connect(2, 201);
  const uint64_t damaged = connections[2].first;
  connect(3, 200);
  service->rows.commit();
  kill();
  const auto contents = JournalReader::read(options.folder, kEpoch);
  const std::string segment = onlySegment();
  {
    std::fstream file(segment, std::ios::binary | std::ios::in | std::ios::out);
    file.seekp(contents->records[damaged - 1].place.offset + 30);
    file.put('x');
  }
  const Bytes before = bytesOf(segment);
  EXPECT_EQ(recover().ended, 2u);
  EXPECT_THAT(complaints, ElementsAre(HasSubstr("0001.vxj is damaged")));
  EXPECT_EQ(bytesOf(segment + ".aside-1"), before);
}

TEST_F(RecoveryTest, WhatWasMovedElsewhereIsTakenBackOnce) {
  const std::string moved = root + "/moved";
  const auto move = [&](const std::string& from, const std::string& to) {
    ASSERT_TRUE(JournalFolder::moveTo(from, to).ok());
  };
  beginLife();
  connect(1, 200);
  kill();
  EXPECT_EQ(epochOfJournal(options.folder, moved), kEpoch);
  // The move was cut short: its copies are there, and what it copied.
  move(options.folder, root + "/other");
  std::filesystem::copy(root + "/other", moved);
  for (const char* part : {"/moved", "/moved/segment-0000000000000001.vxj"})
    std::filesystem::permissions(root + part, std::filesystem::perms(0700));
  move(root + "/other", options.folder);
  move(options.folder, moved);
  EXPECT_EQ(epochOfJournal(options.folder, moved), kEpoch);
  EXPECT_THAT(JournalReader::read(options.folder, kEpoch)->records, IsEmpty());
  // Nor can it be taken back at once: the process that finds it so goes on behind it.
  const std::string obstacle = options.folder + "/segment-0000000000000001.vxj.part";
  std::filesystem::create_directory(obstacle);
  beginLife();
  EXPECT_THAT(complaints, SizeIs(1));
  const uint64_t first = connections[1].first;
  connect(2, 201);
  EXPECT_GT(connections[2].first, first + 1000);
  kill();
  std::filesystem::remove(obstacle);
  EXPECT_EQ(recover().ended, 2u);
  EXPECT_THAT(complaints, IsEmpty());
  EXPECT_THAT(JournalReader::read(moved, kEpoch)->records, IsEmpty());
}

}  // namespace
}  // namespace vx::lnx
