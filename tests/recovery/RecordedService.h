// The service on real queues and a journal, its rows kept by the test in the store's place.
#pragma once

#include <algorithm>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "Statistics/Service/VXReportingServiceDelegate.h"
#include "base/Mutex.h"
#include "platform/linux/execution/CauseScope.h"
#include "platform/linux/execution/SystemThreading.h"
#include "platform/linux/ipc/SocketListener.h"
#include "platform/linux/recovery/JournalRecorder.h"
#include "platform/linux/recovery/JournaledInputs.h"
#include "tests/fakes/FakePlatform.h"
#include "tests/wire/SocketEnd.h"
#include "wire/FrameWriter.h"

namespace vx::lnx {

template <class Write>
Bytes callFrame(uint64_t number, wire::Operation operation, std::size_t count, const Write& write) {
  Bytes out;
  wire::FrameWriter call = wire::FrameWriter::call(out, number, operation, count);
  write(call.items());
  call.end();
  return out;
}

// What would be rows, with the causes that the store would keep until they are committed.
class Rows final : public VyrReporting, public AnalyticsEventService, public PowerEventLog {
 public:
  struct Row {
    Cause cause;
    std::string text;
    const void* place;
  };
  void add(std::string text, const Payload& payload = {}) {
    MutexLock lock(mutex_);
    rows_.push_back({Cause::take(), std::move(text), payload.identity()});
  }
  void commit() {
    MutexLock lock(mutex_);
    rows_.clear();
  }
  // "call:place text", by key.
  std::vector<std::string> texts() const {
    MutexLock lock(mutex_);
    std::vector<std::string> all;
    for (const Row& row : rows_) {
      char key[40];
      std::snprintf(key, sizeof key, "%llu:%08x ",
                    static_cast<unsigned long long>(row.cause.key().call), row.cause.key().place);
      all.push_back(key + row.text);
    }
    std::ranges::sort(all);
    return all;
  }
  std::vector<const void*> places(std::string_view beginning) const {
    MutexLock lock(mutex_);
    std::vector<const void*> all;
    for (const Row& row : rows_)
      if (row.text.starts_with(beginning)) all.push_back(row.place);
    return all;
  }

  std::shared_ptr<const VyrSecureHierarchyToken> newSecureHierarchyTokenFromParentToken(
      const VyrSecureHierarchyToken*) override {
    return nullptr;
  }
  std::shared_ptr<VyrReportingSession> initWithSessionInfo(
      const VyrSessionInfo& info, const Payload&, const std::vector<std::string>&) override {
    struct Session final : VyrReportingSession {
      Session(Rows& all, std::string id) : rows(all), name(std::move(id)) {}
      std::string description() const override { return name; }
      void startConfigurationWithCompletionHandler(
          Function<void(std::optional<BackendList>)> handler) override {
        handler(BackendList{"test"});
      }
      bool sendMessageWithCategory(uint16_t, uint16_t, const Payload& payload,
                                   std::optional<Error>&) override {
        rows.add("message " + name + " " + payload.text(), payload);
        return true;
      }
      void flushMessagesWithCompletion(Function<void(std::optional<Error>)> handler) override {
        rows.add("flush " + name);
        handler(std::nullopt);
      }
      Rows& rows;
      const std::string name;
    };
    const std::string id = std::to_string(std::get<int64_t>(info[2].second));
    add("session " + id);
    return std::make_shared<Session>(*this, id);
  }
  bool sendOneMessageWithSessionInfo(const VyrSessionInfo&, const Payload&, uint16_t, uint16_t,
                                     const Payload& payload, std::optional<Error>&) override {
    add("one-off session");
    add("one-off " + payload.text(), payload);
    return true;
  }
  void sendEventLazy(std::string_view name, Function<Payload()> builder, const Payload&) override {
    add("event " + std::string(name) + " " + builder().text());
  }
  void logRegisteredEvent(int64_t, std::string_view name, const Payload&, const Payload*) override {
    add("power " + std::string(name));
  }

 private:
  mutable Mutex mutex_;
  std::vector<Row> rows_ GUARDED_BY(mutex_);
};

// The platform of one life of the service. Its own thread is the test's, unless it serves.
class RecordedService {
 public:
  explicit RecordedService(Journal* journal, AggregateMemory* surviving = nullptr)
      : memory(surviving != nullptr ? *surviving : fakes.aggregates), inputs(journal) {
    installPlatform(&platform);
    delegate = VXReportingServiceDelegate::create();
  }
  ~RecordedService() {
    delegate.reset();
    executor.stop(Monotonic::max());
  }
  void runQueues() {
    while (executor.runInteractive(1024)) {
    }
    ASSERT_TRUE(executor.drain(Monotonic::max()));
  }

  Rows rows;
  fakes::FakePlatform fakes;
  SystemClock steady;
  Executor executor;
  EventLoop loop{executor, steady};
  SocketListener listener{loop, executor, steady, {}};
  SystemThreading threading{executor.background()};
  AggregateMemory& memory;
  JournaledInputs inputs;
  std::shared_ptr<VXReportingServiceDelegate> delegate;

 private:
  // Of use to several threads.
  struct Quiet final : ScopedLog, TracePoint {
    const LogScope* registerScope(bool, uint32_t, std::string_view, std::string_view,
                                  std::string_view, uint32_t) override {
      return nullptr;
    }
    bool isLogEnabled(int, const LogScope*) override { return false; }
    bool wantsLine(const LogScope*, LogLevel, const LogSite&) override { return false; }
    void write(const LogScope*, LogLevel, const LogSite&, std::string_view, std::size_t) override {}
    void emit(uint32_t, uint64_t, uint64_t, uint64_t, uint64_t) override {}
  } quiet_;
  fakes::FakeServices& small_ = fakes.services;

 public:
  Platform platform{.serviceListener = listener,
                    .workQueues = executor,
                    .clock = fakes.clock,
                    .threading = threading,
                    .processInfo = small_,
                    .processControl = small_,
                    .random = small_,
                    .preferences = small_,
                    .systemNotify = small_,
                    .vyrReporting = rows,
                    .analytics = rows,
                    .powerLog = rows,
                    .channelReports = fakes::FakePlatform::noChannels(),
                    .deviceProperties = small_,
                    .orientation = small_,
                    .log = quiet_,
                    .trace = quiet_,
                    .diagnosticFiles = small_,
                    .inputs = inputs,
                    .aggregates = memory};
};

}  // namespace vx::lnx
