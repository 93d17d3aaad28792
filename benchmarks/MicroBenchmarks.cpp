// The steps of a message's road by themselves, one benchmark each.
#include <benchmark/benchmark.h>

#include <atomic>
#include <cstring>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "benchmarks/Workload.h"
#include "client/RealtimeReporter.h"
#include "platform/linux/execution/Executor.h"
#include "platform/linux/journal/Journal.h"
#include "propertylist/CborWriter.h"
#include "propertylist/JsonWriter.h"
#include "propertylist/Payload.h"

namespace vx::bench {
namespace {

std::vector<uint8_t> workloadFrame() {
  std::vector<uint8_t> frame;
  CborWriter writer(frame);
  writer.array(7);
  writer.integer(1);
  writer.integer(100000);
  writer.integer(6);
  writer.encoded(workloadPayload(1).encoded());
  writer.integer(kWorkloadCategory);
  writer.integer(kWorkloadType);
  writer.null();
  return frame;
}

void memcpyOfPayload(benchmark::State& state) {  // the floor of everything below
  const Payload payload = workloadPayload(1);
  std::vector<uint8_t> to(payload.encoded().size());
  for (auto _ : state) {
    std::memcpy(to.data(), payload.encoded().data(), to.size());
    benchmark::DoNotOptimize(to.data());
    benchmark::ClobberMemory();
  }
}
BENCHMARK(memcpyOfPayload);

void decodeFrame(benchmark::State& state) {
  const std::vector<uint8_t> frame = workloadFrame();
  for (auto _ : state) benchmark::DoNotOptimize(Frame::decode(frame));
}
BENCHMARK(decodeFrame);

void decodeFrameAndKeepPayload(benchmark::State& state) {
  const std::vector<uint8_t> frame = workloadFrame();
  for (auto _ : state) {
    benchmark::DoNotOptimize(Frame::decode(frame)->payload(3));
  }
}
BENCHMARK(decodeFrameAndKeepPayload);

void buildPayload(benchmark::State& state) {
  for (auto _ : state) benchmark::DoNotOptimize(workloadPayload(7));
}
BENCHMARK(buildPayload);

void findLastKey(benchmark::State& state) {
  const Payload payload = workloadPayload(1);
  for (auto _ : state) benchmark::DoNotOptimize(payload.find("is_spatialized"));
}
BENCHMARK(findLastKey);

void addOneEntry(benchmark::State& state) {  // what the analytics sink does to a message
  const Payload payload = workloadPayload(1);
  const Payload unknown = PayloadBuilder().set("k", "Unknown").build();
  for (auto _ : state) {
    benchmark::DoNotOptimize(payload.withEntry("HostApplicationDisplayID", *unknown.find("k")));
  }
}
BENCHMARK(addOneEntry);

void writeJson(benchmark::State& state) {
  const Payload payload = workloadPayload(1);
  std::string json;
  for (auto _ : state) {
    json.clear();
    appendJson(json, payload);
    benchmark::DoNotOptimize(json.data());
  }
}
BENCHMARK(writeJson);

void textOfEveryValue(benchmark::State& state) {  // what the summary event is made of
  const Payload payload = workloadPayload(1);
  std::string text;
  for (auto _ : state) {
    text.clear();
    for (const auto& [key, value] : payload) value.appendText(text);
    benchmark::DoNotOptimize(text.data());
  }
  state.SetItemsProcessed(state.iterations() * static_cast<int64_t>(kEntriesPerPayload));
}
BENCHMARK(textOfEveryValue);

// About 200 encoded bytes, as a client sends them.
Payload smallPayload() {
  return PayloadBuilder()
      .set("route", std::string(90, 'r'))
      .set("device", std::string(90, 'd'))
      .build();
}

void copyPayloadToHeap(benchmark::State& state) {  // what a message costs that is not recorded
  const Payload payload = smallPayload();
  const std::span<const uint8_t> bytes = payload.encoded();
  for (auto _ : state) {
    std::unique_ptr<uint8_t[]> copy(new uint8_t[bytes.size()]);
    std::memcpy(copy.get(), bytes.data(), bytes.size());
    benchmark::DoNotOptimize(copy.get());
    benchmark::ClobberMemory();
  }
}
BENCHMARK(copyPayloadToHeap);

// Recorded, let go of, and its segment used again: a snapshot of nothing every 16384 calls.
void appendToJournal(benchmark::State& state) {
  lnx::JournalOptions options;
  options.folder = "/dev/shm/vx-microbench-journal";
  std::filesystem::remove_all(options.folder);
  const auto journal = lnx::Journal::open(options);
  if (!journal.ok()) return state.SkipWithError(journal.status().text().c_str());
  const Payload payload = smallPayload();
  const uint8_t head[] = {1, 2, 3, 4, 5, 6, 7, 8};
  const lnx::JournalRecord record{1, 1.5, 2, head, payload.validated()};
  uint64_t calls = 0;
  bool ok = true;
  for (auto _ : state) {
    const auto appended = journal.value()->append(record);
    ok = ok && appended.ok();
    if ((++calls & 16383) == 0)
      ok = ok && journal.value()->beginGeneration().ok() && journal.value()->endSnapshot().ok();
  }
  if (!ok) state.SkipWithError("the journal is full");
  journal.value()->discard();
  std::filesystem::remove_all(options.folder);
}
BENCHMARK(appendToJournal);

void queueAndRunInteractive(benchmark::State& state) {
  lnx::UserAccounts accounts;
  lnx::Executor executor{accounts};
  executor.adoptInteractiveThread();
  const auto queue = executor.makeSerial("bench", QualityOfService::UserInteractive);
  const auto owner = std::make_shared<int>(0);
  for (auto _ : state) {
    queue->async([owner] { ++*owner; });
    executor.runInteractive(16);
  }
  executor.stop({});
}
BENCHMARK(queueAndRunInteractive);

void queueToUtilityLane(benchmark::State& state) {
  lnx::UserAccounts accounts;
  lnx::Executor executor{accounts};
  const auto queue = executor.makeSerial("bench", QualityOfService::Utility);
  const auto owner = std::make_shared<std::atomic<int>>(0);
  for (auto _ : state) {
    queue->async([owner] { owner->fetch_add(1, std::memory_order_relaxed); });
    while (executor.utilityBacklog() > 100000) {
    }
  }
  executor.drain(Monotonic::max());
  executor.stop(Monotonic::max());
}
BENCHMARK(queueToUtilityLane);

constexpr uint64_t kRing = 4096;
constexpr std::size_t kNumbers = 4;

void pushToBareRing(benchmark::State& state) {  // the floor of the next one
  struct Slot {
    uint64_t words[kNumbers];
  };
  std::vector<Slot> slots(kRing);
  std::atomic<uint64_t> head{0};
  std::atomic<uint64_t> tail{0};
  uint64_t i = 0;
  for (auto _ : state) {
    const uint64_t at = head.load(std::memory_order_relaxed);
    if (at - tail.load(std::memory_order_acquire) == kRing)
      tail.store(at, std::memory_order_release);
    slots[at & (kRing - 1)] = {{i, i, i, i}};
    head.store(at + 1, std::memory_order_release);
    benchmark::ClobberMemory();
    ++i;
  }
}
BENCHMARK(pushToBareRing);

void sendFromAudioThread(benchmark::State& state) {  // the ring is emptied off the clock
  using Kind = RealtimeReporter::Kind;
  const RealtimeReporter::Shape shape{{{"frames", Kind::Integer},
                                       {"peak", Kind::Double},
                                       {"late", Kind::Boolean},
                                       {"load", Kind::Double}},
                                      kWorkloadCategory,
                                      kWorkloadType,
                                      {}};
  auto reporter = std::make_unique<RealtimeReporter>(shape, kRing);
  int64_t i = 0;
  for (auto _ : state) {
    if (!reporter->send({i, 0.5, i % 2 == 0, 0.25})) {
      state.PauseTiming();
      reporter = std::make_unique<RealtimeReporter>(shape, kRing);
      state.ResumeTiming();
    }
    ++i;
  }
}
BENCHMARK(sendFromAudioThread);

}  // namespace
}  // namespace vx::bench
