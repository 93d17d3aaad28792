// Every platform interface in memory: tests own time, and queues run only when a test says so.
#pragma once

#include "platform/linux/device/CounterChannels.h"
#include "tests/fakes/FakeAggregateMemory.h"
#include "tests/fakes/FakeServices.h"

namespace vx::fakes {

class FakeConnection final : public ClientConnection {
 public:
  explicit FakeConnection(int32_t pid) : pid_(pid) {}
  int32_t processIdentifier() const override { return pid_; }
  std::string description() const override { return "<connection>"; }
  void setExportedInterface(const InterfaceDescription& exported) override {
    interface = &exported;
  }
  void setExportedObject(std::shared_ptr<ExportedObject> exported) override {
    object = std::move(exported);
  }
  std::shared_ptr<ExportedObject> exportedObject() const override { return object; }
  void setInterruptionHandler(Function<void()> f) override { interruption = std::move(f); }
  void setInvalidationHandler(Function<void()> f) override { invalidation = std::move(f); }
  void resume() override { resumed = true; }
  const InterfaceDescription* interface = nullptr;
  std::shared_ptr<ExportedObject> object;
  Function<void()> interruption;
  Function<void()> invalidation;
  bool resumed = false;

 private:
  const int32_t pid_;
};

class FakeListener final : public ServiceListener {
 public:
  void setDelegate(std::weak_ptr<ServiceListenerDelegate>) override {}
  void resume() override {}
};

// Asks, unless it stands for a call that is run again: then it gives the answer from before.
class FakeInputs final : public RecordedInputs {
 public:
  std::optional<Payload> once(std::string_view what,
                              const Function<std::optional<Payload>()>& source) override {
    std::optional<Payload>& answer = answers[std::string(what)];
    if (!replaying) answer = source();
    return answer;
  }
  std::map<std::string, std::optional<Payload>> answers;  // the last one to each question
  bool replaying = false;
};

// What stands in the place of its fake.
struct RealServices {
  ServiceListener* listener = nullptr;
  WorkQueues* queues = nullptr;
  Threading* threading = nullptr;
  ChannelReportService* channels = nullptr;
  RecordedInputs* inputs = nullptr;
  AggregateMemory* aggregates = nullptr;
};

// All of them, installed for as long as it lives.
class FakePlatform {
 public:
  explicit FakePlatform(const RealServices& real = {})
      : installed{.serviceListener = either(real.listener, listener),
                  .workQueues = either(real.queues, queues),
                  .clock = clock,
                  .threading = either(real.threading, threading),
                  .processInfo = services,
                  .processControl = services,
                  .random = services,
                  .preferences = services,
                  .systemNotify = services,
                  .vyrReporting = vyr,
                  .analytics = services,
                  .powerLog = services,
                  .channelReports = either(real.channels, channels),
                  .deviceProperties = services,
                  .orientation = services,
                  .log = log,
                  .trace = services,
                  .diagnosticFiles = services,
                  .inputs = either(real.inputs, inputs),
                  .aggregates = either(real.aggregates, aggregates)} {
    installPlatform(&installed);
  }
  ~FakePlatform() { installPlatform(nullptr); }

  Journal journal;
  FakeClock clock;
  FakeWorkQueues queues{clock};
  FakeThreading threading{clock};
  FakeLog log{journal};
  FakeVyrReporting vyr{journal, threading};
  FakeServices services{journal};
  FakeListener listener;
  lnx::CounterChannels channels{{"", {}}};  // none
  FakeInputs inputs;
  FakeAggregateMemory aggregates;
  Platform installed;

 private:
  template <class Interface, class Fake>
  static Interface& either(Interface* real, Fake& fake) {
    return real != nullptr ? *real : fake;
  }
};

}  // namespace vx::fakes
