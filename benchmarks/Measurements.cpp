#include "benchmarks/Measurements.h"

#include <sqlite3.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "benchmarks/BenchDaemon.h"
#include "benchmarks/Floors.h"
#include "benchmarks/RawClient.h"
#include "benchmarks/Workload.h"
#include "client/ReportingClient.h"
#include "platform/linux/journal/Journal.h"

namespace vx::bench {

namespace {

using SteadyClock = std::chrono::steady_clock;

double secondsSince(SteadyClock::time_point start) {
  return std::chrono::duration<double>(SteadyClock::now() - start).count();
}

void progress(const std::string& text) {
  std::printf("  ... %s\n", text.c_str());
  std::fflush(stdout);
}

std::vector<std::vector<uint8_t>> workloadFrames(const int64_t* reporter = nullptr) {
  std::vector<std::vector<uint8_t>> frames;
  for (const Payload& payload : workloadPayloads(64)) {
    frames.push_back(RawClient::messageFrame(payload, reporter));
  }
  return frames;
}

// Reads the daemon's database as an analyst would.
class StoreReader {
 public:
  explicit StoreReader(const std::string& path) {
    if (sqlite3_open_v2(path.c_str(), &database_, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
      throw std::runtime_error("cannot open " + path);
    }
    sqlite3_busy_timeout(database_, 5000);
  }
  ~StoreReader() { sqlite3_close(database_); }
  StoreReader(const StoreReader&) = delete;
  StoreReader& operator=(const StoreReader&) = delete;

  // Counts what is new at each look: a count of everything would hold the log of the writer that
  // is measured, for longer the more there is.
  void waitFor(int64_t relayRows, int64_t analyticsRows) {
    const auto end = SteadyClock::now() + std::chrono::seconds(120);
    for (;;) {
      look("SELECT count(*), count(event_name), max(id) FROM relay_messages WHERE id > ",
           lastMessage_);
      look("SELECT 0, count(*), max(id) FROM analytics_entries WHERE id > ", lastEntry_);
      if (messages_ >= relayRows && events_ >= analyticsRows) return;
      if (SteadyClock::now() > end)
        throw std::runtime_error("the store did not take every row in time");
      std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
  }

 private:
  void look(const char* query, int64_t& last) {
    sqlite3_stmt* statement = nullptr;
    sqlite3_prepare_v2(database_, (query + std::to_string(last)).c_str(), -1, &statement, nullptr);
    if (sqlite3_step(statement) == SQLITE_ROW && sqlite3_column_type(statement, 2) != SQLITE_NULL) {
      messages_ += sqlite3_column_int64(statement, 0);
      events_ += sqlite3_column_int64(statement, 1);
      last = sqlite3_column_int64(statement, 2);
    }
    sqlite3_finalize(statement);
  }

  sqlite3* database_ = nullptr;
  int64_t lastMessage_ = 0, lastEntry_ = 0;
  int64_t messages_ = 0, events_ = 0;
};

std::vector<double> timedRoundTrips(RawClient& client,
                                    const std::vector<std::vector<uint8_t>>& frames,
                                    std::size_t count) {
  std::vector<double> times;
  times.reserve(count);
  for (std::size_t i = 0; i < count; ++i) {
    const auto start = SteadyClock::now();
    client.sendOnce(frames[i % frames.size()]);
    times.push_back(secondsSince(start) * 1e9);
  }
  return times;
}

}  // namespace

Effort Effort::quickEffort() {
  Effort effort;
  effort.quick = true;
  effort.roundTripsPerRound = 5000;
  effort.sustainedMessages = 250000;
  effort.idleSeconds = 5;
  effort.trickleSeconds = 20;
  return effort;
}

void measureStart(Results& results, const Effort& effort) {
  progress("start to ready");
  std::vector<double> times;
  for (std::size_t i = 0; i < effort.rounds + 1; ++i) {
    BenchDaemon daemon;
    if (i > 0) times.push_back(daemon.startToReadyMs());  // the first one warms the file cache
    daemon.stop();
  }
  results.add({.name = "start_to_ready_ms",
               .value = median(times),
               .unit = "ms",
               .floor = {},
               .ratio = {},
               .reach = {},
               .what = "process start until it says that it is ready"},
              60, 20, false);
}

void measureRoundTrip(Results& results, const Effort& effort) {
  progress("round trips on one CPU");
  constexpr int kCpu = 0;
  DaemonOptions options;
  options.cpu = kCpu;
  BenchDaemon daemon(options);
  EchoFloor echo(callBytes(workloadPayload(1)), kReplyBytes, kCpu);
  pinThisThread(kCpu);
  RawClient client(daemon.socketPath());
  client.create(1);
  client.start(1);
  const auto frames = workloadFrames();
  timedRoundTrips(client, frames, 2000);
  echo.roundTrips(2000);
  std::vector<double> p50, p99, floor50, floor99, ratio50, ratio99;
  for (std::size_t round = 0; round < effort.rounds; ++round) {
    const std::vector<double> floor = echo.roundTrips(effort.roundTripsPerRound);
    const std::vector<double> times = timedRoundTrips(client, frames, effort.roundTripsPerRound);
    p50.push_back(percentile(times, 0.5));
    p99.push_back(percentile(times, 0.99));
    floor50.push_back(percentile(floor, 0.5));
    floor99.push_back(percentile(floor, 0.99));
    ratio50.push_back(p50.back() / floor50.back());
    ratio99.push_back(p99.back() / floor99.back());
  }
  pinThisThread(-1);
  results.add(
      {.name = "roundtrip_p50_same_cpu",
       .value = median(p50),
       .unit = "ns",
       .floor = median(floor50),
       .ratio = median(ratio50),
       .reach = {},
       .what = "one sendMessage at a time into a started session, client and daemon on one CPU"},
      1.6, 1.25, false);
  results.add({.name = "roundtrip_p99_same_cpu",
               .value = median(p99),
               .unit = "ns",
               .floor = median(floor99),
               .ratio = median(ratio99),
               .reach = {},
               .what = "the same, 99th percentile"},
              2.0, 1.4, false);
}

// Two users: who connects with another effective user is one to the daemon.
void measureFlood(Results& results, const Effort& effort) {
  if (geteuid() != 0) return progress("a flood by another user is left out: only root can be two");
  progress("round trips while another user floods");
  constexpr uid_t kFlooder = 65534;
  constexpr std::size_t kWindow = 256;
  constexpr auto kPause = std::chrono::microseconds(500);
  BenchDaemon daemon;
  const std::filesystem::path folder = std::filesystem::path(daemon.socketPath()).parent_path();
  std::filesystem::permissions(
      folder, std::filesystem::perms::group_exec | std::filesystem::perms::others_exec,
      std::filesystem::perm_options::add);
  RawClient client(daemon.socketPath());
  if (seteuid(kFlooder) != 0) throw std::runtime_error("cannot be another user");
  RawClient other(daemon.socketPath());
  if (seteuid(0) != 0) throw std::runtime_error("cannot be root again");
  const int64_t ids[] = {1, 2};
  client.create(ids[0]);
  client.start(ids[0]);
  other.create(ids[1]);
  other.start(ids[1]);
  const auto own = workloadFrames(&ids[0]);
  const auto flood = workloadFrames(&ids[1]);
  const auto percentile99 = [&] {
    std::vector<double> times;
    for (std::size_t i = 0; i < effort.roundTripsPerRound / 10; ++i) {
      std::this_thread::sleep_for(kPause);
      times.push_back(timedRoundTrips(client, own, 1).front());
    }
    return percentile(times, 0.99);
  };
  std::vector<double> quiet, flooded, ratios;
  for (std::size_t round = 0; round < effort.rounds; ++round) {
    daemon.waitUntilIdle();
    quiet.push_back(percentile99());
    std::atomic<bool> enough{false};
    std::thread flooder([&] {
      while (!enough) other.pump(flood, 10000, kWindow);
    });
    flooded.push_back(percentile99());
    enough = true;
    flooder.join();
    ratios.push_back(flooded.back() / quiet.back());
  }
  results.add({.name = "flood_p99_ratio",
               .value = median(flooded),
               .unit = "ns",
               .floor = median(quiet),
               .ratio = median(ratios),
               .reach = {},
               .what = "a round trip each half millisecond, 99th percentile, beside one connection "
                       "of another user that sends all it can; over the same without it"},
              60, 10, false);
}

void measureAccepted(Results& results, const Effort& effort) {
  progress("bursts of messages into an idle store");
  constexpr std::size_t kWindow = 256;
  BenchDaemon daemon;
  EchoFloor echo(callBytes(workloadPayload(1)), kReplyBytes, -1);
  RawClient client(daemon.socketPath());
  client.create(1);
  client.start(1);
  const auto frames = workloadFrames();
  client.pump(frames, effort.burstMessages, kWindow);
  std::vector<double> rates, floors, ratios;
  for (std::size_t round = 0; round < effort.rounds; ++round) {
    daemon.waitUntilIdle();
    floors.push_back(echo.messagesPerSecond(effort.burstMessages, kWindow));
    const auto start = SteadyClock::now();
    client.pump(frames, effort.burstMessages, kWindow);
    rates.push_back(static_cast<double>(effort.burstMessages) / secondsSince(start));
    ratios.push_back(rates.back() / floors.back());
  }
  results.add({.name = "accepted_per_s",
               .value = median(rates),
               .unit = "1/s",
               .floor = median(floors),
               .ratio = median(ratios),
               .reach = {},
               .what = "256 calls outstanding, replies counted, bursts of 30,000 messages, store "
                       "idle before each"},
              0.8, 1.5, true);
}

void measureSustained(Results& results, const Effort& effort) {
  constexpr std::size_t kWindow = 256;
  BenchDaemon daemon;
  SqliteFloor sqlite(daemon.folder());
  RawClient client(daemon.socketPath());
  client.create(1);
  client.start(1);
  const auto frames = workloadFrames();
  // Buffers reach their working size before memory is measured.
  constexpr std::size_t kWarmUp = 50000;
  client.pump(frames, kWarmUp, kWindow);
  StoreReader store(daemon.databasePath());
  auto rows = static_cast<int64_t>(kWarmUp);
  store.waitFor(rows, rows);
  sqlite.run(kWarmUp);
  daemon.waitUntilIdle();
  const uint64_t memoryBefore = daemon.anonymousBytes() + daemon.aggregateBytes();
  std::vector<double> rates, floors, ratios, cpu, cpuFloors, cpuRatios;
  const std::size_t perRound = effort.sustainedMessages / effort.rounds;
  for (std::size_t round = 0; round < effort.rounds; ++round) {
    progress("sustained messages, round " + std::to_string(round + 1) + " of " +
             std::to_string(effort.rounds));
    const SqliteFloorResult floor = sqlite.run(perRound);
    const double cpuBefore = daemon.cpuSeconds();
    const auto start = SteadyClock::now();
    client.pump(frames, perRound, kWindow);
    rows += static_cast<int64_t>(perRound);
    store.waitFor(rows, rows);
    rates.push_back(static_cast<double>(perRound) / secondsSince(start));
    cpu.push_back((daemon.cpuSeconds() - cpuBefore) * 1e6 / static_cast<double>(perRound));
    floors.push_back(floor.rowsPerSecond);
    cpuFloors.push_back(floor.cpuMicrosecondsPerRow);
    ratios.push_back(rates.back() / floors.back());
    cpuRatios.push_back(cpu.back() / cpuFloors.back());
  }
  daemon.waitUntilIdle();
  const auto memoryAfter = static_cast<double>(daemon.anonymousBytes() + daemon.aggregateBytes());
  const double memory = (memoryAfter - static_cast<double>(memoryBefore)) /
                        static_cast<double>(perRound * effort.rounds);
  const auto encoded = static_cast<double>(workloadPayload(1).encoded().size());
  results.add(
      {.name = "stored_per_s",
       .value = median(rates),
       .unit = "1/s",
       .floor = median(floors),
       .ratio = median(ratios),
       .reach = {},
       .what =
           "messages whose two rows are committed, sustained, against rows of a bare SQLite loop"},
      0.35, 0.5, true);
  results.add({.name = "daemon_cpu_us_per_message",
               .value = median(cpu),
               .unit = "us",
               .floor = median(cpuFloors),
               .ratio = median(cpuRatios),
               .reach = {},
               .what = "all threads of the daemon, against the bare SQLite loop's CPU per row"},
              3.0, 2.0, false);
  results.add(
      {.name = "bytes_per_aggregated_message",
       .value = memory,
       .unit = "B",
       .floor = encoded,
       .ratio = {},
       .reach = {},
       .what = "growth of memory per message kept by one session, over its encoding: anonymous "
               "pages and the files of the aggregates, not the journal, which is bounded"},
      0.6, 0.35, false);
  results.note("memcpy_of_payload_ns", memcpyNanoseconds(static_cast<std::size_t>(encoded)), "ns",
               "copying one payload's bytes");
}

void measureIdle(Results& results, const Effort& effort) {
  progress("an idle daemon for " + std::to_string(effort.idleSeconds) + " s");
  BenchDaemon daemon;
  RawClient client(daemon.socketPath());
  daemon.waitUntilIdle();
  results.add({.name = "idle_rss_mib",
               .value = static_cast<double>(daemon.residentBytes()) / (1 << 20),
               .unit = "MiB",
               .floor = {},
               .ratio = {},
               .reach = {},
               .what = "resident memory with one client connected"},
              7, 4.5, false);
  client.create(1);
  client.start(1);
  // The rows of the start are committed by then.
  std::this_thread::sleep_for(std::chrono::seconds(6));
  daemon.waitUntilIdle();
  const uint64_t before = daemon.voluntarySwitches();
  std::this_thread::sleep_for(std::chrono::seconds(effort.idleSeconds));
  const double wakeups = static_cast<double>(daemon.voluntarySwitches() - before) * 60.0 /
                         static_cast<double>(effort.idleSeconds);
  results.add(
      {.name = "idle_wakeups_per_minute",
       .value = wakeups,
       .unit = "1/min",
       .floor = {},
       .ratio = {},
       .reach = {},
       .what = "voluntary context switches of all threads, one idle client, one started session"},
      0, 0, false);
}

void measureTrickle(Results& results, const Effort& effort) {
  progress("two messages a second for " + std::to_string(effort.trickleSeconds) + " s");
  constexpr std::chrono::milliseconds kPause{500};
  DaemonOptions options;
  options.countSyncs = true;
  BenchDaemon daemon(options);
  RawClient client(daemon.socketPath());
  client.create(1);
  client.start(1);
  const auto frames = workloadFrames();
  const std::size_t messages = effort.trickleSeconds * 2;
  auto next = SteadyClock::now();
  auto send = [&](std::size_t count) {
    for (std::size_t i = 0; i < count; ++i) {
      std::this_thread::sleep_until(next += kPause);
      client.sendOnce(frames[i % frames.size()]);
    }
  };
  send(12);  // the session is set up, and the store begun and committed to
  const uint64_t bytes = daemon.writtenBytes();
  const uint64_t syncs = daemon.syncs();
  const uint64_t switches = daemon.voluntarySwitches();
  send(messages);
  const auto count = static_cast<double>(messages);
  results.add({.name = "flash_bytes_per_message",
               .value = static_cast<double>(daemon.writtenBytes() - bytes) / count,
               .unit = "B",
               .floor = {},
               .ratio = {},
               .reach = {},
               .what = "bytes for the disk at two messages a second into one session"},
              4096, 1024, false);
  results.add({.name = "syncs_per_minute",
               .value = static_cast<double>(daemon.syncs() - syncs) * 60.0 /
                        static_cast<double>(effort.trickleSeconds),
               .unit = "1/min",
               .floor = {},
               .ratio = {},
               .reach = {},
               .what = "fsync and fdatasync meanwhile"},
              12, 12, false);
  results.add({.name = "wakeups_per_message",
               .value = static_cast<double>(daemon.voluntarySwitches() - switches) / count,
               .unit = "",
               .floor = {},
               .ratio = {},
               .reach = {},
               .what = "voluntary context switches of all threads meanwhile"},
              4, 4, false);
}

void measureCrashSafety(Results& results, const Effort& effort) {
  progress("recording a call");
  lnx::JournalOptions options;
  options.folder = "/dev/shm/vxbench-journal-" + std::to_string(getpid());
  const auto journal = lnx::Journal::open(options);
  if (!journal.ok()) throw std::runtime_error(journal.status().text());
  const Payload payload = workloadPayload(1);
  const std::span<const uint8_t> bytes = payload.encoded();
  const uint8_t head[] = {1, 2, 3, 4, 5, 6, 7, 8};
  const lnx::JournalRecord record{1, 1.5, 2, head, payload.validated()};
  constexpr int kCalls = 1 << 14;  // between snapshots of nothing, after which segments are reused
  std::vector<double> added;
  for (std::size_t round = 0; round < effort.rounds * 8; ++round) {
    const auto start = SteadyClock::now();
    for (int i = 0; i < kCalls; ++i) {
      std::unique_ptr<uint8_t[]> copy(new uint8_t[bytes.size()]);
      std::memcpy(copy.get(), bytes.data(), bytes.size());
      asm volatile("" : : "r"(copy.get()) : "memory");
    }
    const double heap = secondsSince(start);
    const auto recording = SteadyClock::now();
    bool ok = journal.value()->beginGeneration().ok() && journal.value()->endSnapshot().ok();
    for (int i = 0; i < kCalls; ++i) ok = journal.value()->append(record).ok() && ok;
    if (!ok) throw std::runtime_error("the journal is full");
    added.push_back((secondsSince(recording) - heap) * 1e9 / kCalls);
  }
  journal.value()->discard();
  std::filesystem::remove_all(options.folder);
  results.add({.name = "crash_safe_ns",
               .value = median(added),
               .unit = "ns",
               .floor = {},
               .ratio = {},
               .reach = {},
               .what = "what the journal adds to a call: recorded, instead of copied to the heap"},
              150, 40, false);
}

void measureSessions(Results& results, const Effort&) {
  progress("10,000 sessions that wait to be started");
  constexpr int64_t kSessions = 10000;
  BenchDaemon daemon;
  RawClient client(daemon.socketPath());
  const Payload configuration =
      PayloadBuilder().set("HostApplicationDisplayID", "com.example.player").build();
  auto make = [&](int64_t reporter) {
    client.create(reporter);
    client.setServiceType(7, reporter);
    client.configure(configuration, reporter);
  };
  make(kSessions + 1);
  daemon.waitUntilIdle();
  const uint64_t before = daemon.anonymousBytes();
  for (int64_t reporter = 1; reporter <= kSessions; ++reporter) make(reporter);
  daemon.waitUntilIdle();
  results.add({.name = "bytes_per_idle_session",
               .value = static_cast<double>(daemon.anonymousBytes() - before) / kSessions,
               .unit = "B",
               .floor = {},
               .ratio = {},
               .reach = {},
               .what = "growth over 10,000 created and configured sessions"},
              2048, 1024, false);
}

void measureStop(Results& results, const Effort& effort) {
  constexpr std::size_t kMessages = 200000;
  DaemonOptions options;
  options.internalBuild = true;
  std::vector<double> perValue, stalls;
  const std::size_t rounds = effort.quick ? 3 : effort.rounds;
  for (std::size_t round = 0; round < rounds; ++round) {
    progress("stopping a session of 200,000 messages, round " + std::to_string(round + 1) + " of " +
             std::to_string(rounds));
    BenchDaemon daemon(options);
    RawClient client(daemon.socketPath());
    RawClient other(daemon.socketPath());
    client.create(1);
    client.start(1);
    client.pump(workloadFrames(), kMessages, 256);
    StoreReader store(daemon.databasePath());
    store.waitFor(static_cast<int64_t>(kMessages), static_cast<int64_t>(kMessages));
    daemon.waitUntilIdle();
    // A second client asks for something small over and over; its longest wait is the stall.
    std::atomic<bool> done{false};
    double longest = 0;
    std::thread second([&] {
      while (!done.load()) {
        const auto start = SteadyClock::now();
        other.create(99);
        longest = std::max(longest, secondsSince(start) * 1e3);
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
      }
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    const auto start = SteadyClock::now();
    client.stop(1);
    perValue.push_back(secondsSince(start) * 1e9 /
                       static_cast<double>(kMessages * kEntriesPerPayload));
    done.store(true);
    second.join();
    stalls.push_back(longest);
  }
  results.add({.name = "stop_ns_per_value",
               .value = median(perValue),
               .unit = "ns",
               .floor = {},
               .ratio = {},
               .reach = {},
               .what = "stop call to its reply with 200,000 messages, summary and file included"},
              150, 60, false);
  results.note("stall_ms_while_stopping", median(stalls), "ms",
               "longest answer a second client waits for meanwhile (aim: under 50)");
}

void measureClientSend(Results& results, const Effort& effort) {
  progress("the client library's non-blocking send");
  BenchDaemon daemon;
  ReportingClient client;
  if (!client.connect(daemon.socketPath()).ok())
    throw std::runtime_error("the client cannot connect");
  client.createReportingSession(1);
  const std::vector<Payload> payloads = workloadPayloads(64);
  const std::vector<int64_t> nobody{
      0};  // routed to no session: the daemon's work stays out of the way
  constexpr std::size_t kBatch = 64;
  std::vector<double> times;
  std::size_t answered = 0;
  std::size_t sent = 0;
  for (std::size_t i = 0; i < effort.roundTripsPerRound; ++i) {
    const auto start = SteadyClock::now();
    for (std::size_t k = 0; k < kBatch; ++k) {
      client.sendMessageAsync(payloads[k], kWorkloadCategory, kWorkloadType, nobody,
                              [&answered](const auto&) { ++answered; });
    }
    times.push_back(secondsSince(start) * 1e9 / static_cast<double>(kBatch));
    sent += kBatch;
    while (answered < sent) client.process();
  }
  results.add({.name = "client_send_ns",
               .value = median(times),
               .unit = "ns",
               .floor = {},
               .ratio = {},
               .reach = {},
               .what = "time inside the client library's non-blocking send"},
              500, 200, false);
}

void measureConnections(Results& results, const Effort&) {
  progress("10,000 connections");
  constexpr std::size_t kConnections = 10000;
  rlimit limit{};
  getrlimit(RLIMIT_NOFILE, &limit);
  limit.rlim_cur = limit.rlim_max;
  setrlimit(RLIMIT_NOFILE, &limit);
  BenchDaemon daemon;
  { RawClient warm(daemon.socketPath()); }
  daemon.waitUntilIdle();
  const uint64_t before = daemon.anonymousBytes();
  std::vector<RawClient> clients;
  clients.reserve(kConnections);
  const auto start = SteadyClock::now();
  while (clients.size() < kConnections) clients.emplace_back(daemon.socketPath());
  clients.back().create(1);  // registered: the service queue has come to the last one
  const double seconds = secondsSince(start);
  daemon.waitUntilIdle();
  const double mib = static_cast<double>(daemon.anonymousBytes() - before) / (1 << 20);
  results.add({.name = "connect_10000_s",
               .value = seconds,
               .unit = "s",
               .floor = {},
               .ratio = {},
               .reach = {},
               .what = "10,000 connections opened and registered"},
              3, 3, false);
  results.add({.name = "connect_10000_mib",
               .value = mib,
               .unit = "MiB",
               .floor = {},
               .ratio = {},
               .reach = {},
               .what = "the daemon's memory for them"},
              64, 64, false);
}

void measureGrowth(const char* file, const Effort& effort) {
  std::string json = "{\"clients\": [\n";
  const std::size_t total = effort.quick ? 50000 : 200000;
  char line[256];
  for (const std::size_t count : {1u, 10u, 100u, 1000u}) {
    progress(std::to_string(count) + " clients");
    BenchDaemon daemon;
    std::vector<RawClient> clients;
    const uint64_t before = daemon.anonymousBytes();
    for (std::size_t i = 0; i < count; ++i) {
      clients.emplace_back(daemon.socketPath());
      clients.back().create(static_cast<int64_t>(i + 1));
      clients.back().start(static_cast<int64_t>(i + 1));
    }
    daemon.waitUntilIdle();
    const double kib =
        static_cast<double>(daemon.anonymousBytes() - before) / 1024 / static_cast<double>(count);
    const double cpuBefore = daemon.cpuSeconds();
    const auto start = SteadyClock::now();
    const std::size_t perTurn = 50;
    for (std::size_t sent = 0; sent < total;) {
      for (std::size_t i = 0; i < count && sent < total; ++i, sent += perTurn) {
        const auto reporter = static_cast<int64_t>(i + 1);
        static const Payload payload = workloadPayload(1);
        clients[i].pump({RawClient::messageFrame(payload, &reporter)}, perTurn, perTurn);
      }
    }
    const double seconds = secondsSince(start);
    daemon.waitUntilIdle();
    std::snprintf(line, sizeof line,
                  "%s{\"n\": %zu, \"messages_per_s\": %.0f, \"cpu_us_per_message\": %.2f, "
                  "\"kib_each\": %.1f}",
                  count == 1 ? "" : ",\n", count, static_cast<double>(total) / seconds,
                  (daemon.cpuSeconds() - cpuBefore) * 1e6 / static_cast<double>(total), kib);
    json += line;
  }
  json += "],\n\"sessions\": [\n";
  for (const std::size_t count : {1u, 10u, 1000u}) {
    progress(std::to_string(count) + " started sessions per message");
    BenchDaemon daemon;
    RawClient client(daemon.socketPath());
    const uint64_t before = daemon.anonymousBytes();
    for (std::size_t i = 0; i < count; ++i) {
      client.create(static_cast<int64_t>(i + 1));
      client.start(static_cast<int64_t>(i + 1));
    }
    daemon.waitUntilIdle();
    const double kib =
        static_cast<double>(daemon.anonymousBytes() - before) / 1024 / static_cast<double>(count);
    const std::size_t messages = std::max<std::size_t>(100, total / count / 2);
    const double cpuBefore = daemon.cpuSeconds();
    const auto start = SteadyClock::now();
    client.pump(workloadFrames(), messages, 256);
    const double accepted = static_cast<double>(messages) / secondsSince(start);
    StoreReader(daemon.databasePath())
        .waitFor(static_cast<int64_t>(messages * count), static_cast<int64_t>(messages * count));
    const double seconds = secondsSince(start);
    daemon.waitUntilIdle();
    std::snprintf(
        line, sizeof line,
        "%s{\"n\": %zu, \"messages_per_s\": %.0f, \"deliveries_stored_per_s\": %.0f, "
        "\"cpu_us_per_delivery\": %.2f, \"kib_each\": %.1f}",
        count == 1 ? "" : ",\n", count, accepted, static_cast<double>(messages * count) / seconds,
        (daemon.cpuSeconds() - cpuBefore) * 1e6 / static_cast<double>(messages * count), kib);
    json += line;
  }
  json += "]}\n";
  std::ofstream(file) << json;
}

}  // namespace vx::bench
