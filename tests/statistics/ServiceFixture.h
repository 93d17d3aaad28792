// The service on fakes, with verbs for what clients and the platform do to it.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Statistics/Service/VXReportingServiceDelegate.h"
#include "Statistics/VXReportingProcessState.h"
#include "tests/fakes/FakePlatform.h"
#include "tests/statistics/DriverChannels.h"

namespace vx {

using ::testing::AllOf;
using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;

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

class ServiceTest : public ::testing::Test {
 protected:
  static constexpr MessageCategory kSetup = 0x08000005;

  ServiceTest() {
    p.services.processNames[200] = "player";
    p.services.processNames[201] = "phone";
    service = VXReportingServiceDelegate::create();
  }
  ~ServiceTest() override {
    p.queues.runAll();
    clients.clear();
    connections.clear();
    service.reset();
    p.queues.runAll();
  }

  // A registered client.
  VXReportingServerInstance& connect(int32_t pid = 200) {
    auto connection = std::make_shared<fakes::FakeConnection>(pid);
    connections.push_back(connection);
    service->listener(p.listener, connection);
    clients.push_back(std::static_pointer_cast<VXReportingServerInstance>(connection->object));
    p.queues.runAll();
    return *clients.back();
  }
  void create(VXReportingServerInstance& client, ReporterID id) {
    client.createReportingSession(id, booleans("create"));
    p.queues.runAll();
  }
  void start(VXReportingServerInstance& client, ReporterID id) {
    client.startReportingSessionForID(id, booleans("start"));
    p.queues.runAll();
  }
  void started(VXReportingServerInstance& client, ReporterID id, ServiceType type = 0) {
    create(client, id);
    client.setServiceType(type, id, booleans("type"));
    start(client, id);
  }
  void configure(VXReportingServerInstance& client, ReporterID id, std::optional<Payload> with) {
    client.setConfiguration(std::move(with), id, booleans("configure"));
    p.queues.runAll();
  }
  void stop(VXReportingServerInstance& client, ReporterID id) {
    client.stopReportingSessionForID(id, booleans("stop"));
    p.queues.runAll();
  }
  void send(VXReportingServerInstance& client, const Payload& message, MessageCategory category,
            MessageType type, std::optional<std::vector<ReporterID>> ids = std::nullopt) {
    client.sendMessage(message, category, type, std::move(ids),
                       [this](const std::optional<Error>& error) {
                         p.journal.push_back(error ? "reply send " + error->domain + " " +
                                                         std::to_string(error->code)
                                                   : "reply send");
                       });
    p.queues.runAll();
  }
  Function<void(bool)> booleans(const std::string& name) {
    return [this, name](bool value) {
      p.journal.push_back("reply " + name + (value ? " true" : " false"));
    };
  }
  std::shared_ptr<VXReportingSession> session(VXReportingServerInstance& client, ReporterID id) {
    const OnServiceQueue here{p};
    return client.findReportingSessionForID(id, VXReportingServerInstance::Lookup::OwnMap);
  }
  // What the journal gained while `steps` ran, only lines that contain one of `interesting` (all
  // when empty).
  template <class Steps>
  fakes::Journal during(const Steps& steps, std::vector<std::string> interesting = {}) {
    const std::size_t before = p.journal.size();
    steps();
    fakes::Journal gained;
    for (std::size_t i = before; i < p.journal.size(); ++i) {
      bool wanted = interesting.empty();
      for (const std::string& part : interesting)
        wanted = wanted || p.journal[i].find(part) != std::string::npos;
      if (wanted) gained.push_back(p.journal[i]);
    }
    return gained;
  }
  static Payload message() { return PayloadBuilder().set("a", 1).build(); }

  // What belongs to the service queue, done there.
  template <class Steps>
  decltype(auto) onQueue(const Steps& steps) {
    const OnServiceQueue here{p};
    return steps();
  }

  DriverChannels drivers;
  fakes::FakePlatform p{drivers};
  VXReportingProcessState processState;
  std::shared_ptr<VXReportingServiceDelegate> service;
  std::vector<std::shared_ptr<fakes::FakeConnection>> connections;
  std::vector<std::shared_ptr<VXReportingServerInstance>> clients;
};

}  // namespace vx
