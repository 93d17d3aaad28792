// The service on fakes, with verbs for what clients and the platform do to it.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <fstream>
#include <iterator>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Statistics/Service/VXReportingServiceDelegate.h"
#include "Statistics/VXReportingProcessState.h"
#include "platform/linux/device/CounterChannels.h"
#include "tests/fakes/FakePlatform.h"
#include "tests/linux/FolderTest.h"
#include "tests/propertylist/Dictionary.h"

namespace vx {

using namespace std::chrono_literals;
using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::Pair;
using ::testing::UnorderedElementsAre;

// The test's own code is an item of the service queue while this lives.
class OnServiceQueue {
 public:
  explicit OnServiceQueue(fakes::FakePlatform& platform)
      : current_(platform.queues.current), outer_(current_) {
    current_ = serviceQueue().get();
  }
  ~OnServiceQueue() { current_ = outer_; }

 private:
  const WorkQueue*& current_;
  const WorkQueue* const outer_;
};

class DriverChannels final : public lnx::Folder, public lnx::CounterChannels {
 public:
  DriverChannels() : CounterChannels({folder, {}}) {}
  ChannelDictionaryRef createSamples(ChannelSubscription* subscription,
                                     const ChannelDictionaryRef& subscribed,
                                     std::optional<Error>& error) override {
    if (onSample) onSample();
    return CounterChannels::createSamples(std::exchange(failNext, false) ? nullptr : subscription,
                                          subscribed, error);
  }
  std::optional<std::string_view> channelName(const ChannelSample& sample) override {
    return nameless ? std::nullopt : CounterChannels::channelName(sample);
  }
  std::function<void()> onSample;
  bool nameless = false;
  bool failNext = false;
};

class PlatformTest : public ::testing::Test {
 protected:
  void run() { p.queues.runAll(); }
  void mark() { marked_ = p.journal.size(); }
  // What the journal gained since the last verb, or mark(): only lines that hold one of
  // `interesting` (all when empty).
  fakes::Journal gained(const std::vector<std::string>& interesting = {}) {
    fakes::Journal lines;
    for (; marked_ < p.journal.size(); ++marked_) {
      const std::string& line = p.journal[marked_];
      const auto holds = [&](const std::string& part) { return line.find(part) != line.npos; };
      if (interesting.empty() || std::ranges::any_of(interesting, holds)) lines.push_back(line);
    }
    return lines;
  }
  // The same lines in one text, after the name of the step that they came of.
  std::string told(const std::string& step, const std::vector<std::string>& interesting = {}) {
    run();
    std::string lines = step + "\n";
    for (const std::string& line : gained(interesting)) lines += "  " + line + "\n";
    return lines;
  }
  static std::string dataFile(const std::string& name) {
    std::ifstream file(VX_TEST_DATA "/" + name);
    return {std::istreambuf_iterator<char>(file), {}};
  }

  DriverChannels drivers;
  fakes::FakePlatform p{{.channels = &drivers}};

 private:
  std::size_t marked_ = 0;
};

class ServiceTest : public PlatformTest {
 protected:
  static constexpr MessageCategory kSetup = 0x08000005;
  using Client = VXReportingServerInstance;

  ServiceTest() {
    p.services.processNames = {{200, "player"}, {201, "phone"}};
    service = VXReportingServiceDelegate::create();
  }
  ~ServiceTest() override {
    run();
    clients.clear();
    connections.clear();
    service.reset();
    run();
  }

  // What belongs to the service queue, done there.
  template <class Steps>
  decltype(auto) onQueue(const Steps& steps) {
    const OnServiceQueue here{p};
    return steps();
  }
  // A registered client.
  Client& connect(int32_t pid = 200) {
    mark();
    auto connection = std::make_shared<fakes::FakeConnection>(pid);
    connections.push_back(connection);
    service->listener(p.listener, connection);
    clients.push_back(std::static_pointer_cast<Client>(connection->object));
    run();
    return *clients.back();
  }

  const Payload message = dictionary("a", 1);
  VXReportingProcessState processState;
  std::shared_ptr<VXReportingServiceDelegate> service;
  std::vector<std::shared_ptr<fakes::FakeConnection>> connections;
  std::vector<std::shared_ptr<Client>> clients;
};

// Sessions alone, as the service queue sees them.
class SessionTest : public ServiceTest {
 protected:
  std::shared_ptr<VXReportingSession> make(ServiceType type = 0, ReporterID id = 42) {
    auto made = VXReportingSession::initWithID(id, {200});
    if (type != kServiceTypeUnknown) made->setServiceType(type);
    return made;
  }
  std::shared_ptr<VXReportingSession> startedSession(ServiceType type = 3) {
    auto made = make(type);
    made->start();
    run();
    return made;
  }
  static std::vector<std::string> texts(const std::optional<std::vector<Payload>>& payloads) {
    std::vector<std::string> all;
    for (const Payload& payload : payloads.value_or(std::vector<Payload>()))
      all.push_back(payload.text());
    return all;
  }
  const OnServiceQueue here_{p};
};

}  // namespace vx
