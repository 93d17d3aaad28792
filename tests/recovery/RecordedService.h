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

namespace vx::lnx {

// Identifiers as one item of a frame; null without any.
inline Bytes listOf(const std::vector<int64_t>& ids) {
  Bytes item;
  CborWriter writer(item);
  if (ids.empty()) writer.null();
  if (!ids.empty()) writer.array(ids.size());
  for (const int64_t id : ids) writer.integer(id);
  return item;
}

// What would be rows, with the causes that the store would keep until they are committed.
class Rows {
 public:
  struct Row {
    Cause cause;
    std::string text;
    const void* place;
  };
  bool add(std::string text, const Payload& payload) {
    MutexLock lock(mutex_);
    rows_.push_back({Cause::take(), std::move(text), payload.identity()});
    return true;
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

 private:
  mutable Mutex mutex_;
  std::vector<Row> rows_ GUARDED_BY(mutex_);
};

// The platform of one life of the service. Its own thread is the test's, unless it serves.
class RecordedService {
 public:
  explicit RecordedService(Journal* journal, AggregateMemory* surviving = nullptr)
      : fakes({.listener = &listener,
               .queues = &executor,
               .threading = &threading,
               .inputs = &inputs,
               .aggregates = surviving}),
        inputs(journal) {
    fakes.journal.silent = true;  // of use to several threads
    fakes.services.toRows = fakes.vyr.toRows = std::bind_front(&Rows::add, &rows);
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
  // The process state of a test, which may end later, holds delayed messages that are on these.
  static UserAccounts& sharedAccounts() {
    static UserAccounts shared{MemoryLimits{}};
    return shared;
  }
  UserAccounts& accounts = sharedAccounts();
  Executor executor{accounts};
  EventLoop loop{executor, steady};
  SocketListener listener{loop, executor, steady, {}};
  SystemThreading threading{executor.background()};
  JournaledInputs inputs;
  std::shared_ptr<VXReportingServiceDelegate> delegate;
};

}  // namespace vx::lnx
