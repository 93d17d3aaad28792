// The device's orientation sensor, behind a service on the system bus.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "base/Function.h"
#include "base/ThreadChecker.h"

struct pollfd;
struct sd_bus;
struct sd_bus_message;

namespace vx::lnx {

// Reads the property AccelerometerOrientation of net.hadess.SensorProxy ("normal", "bottom-up",
// "left-up", "right-up", "undefined"). The service may be absent, appear, vanish and come back; a
// claim that fails is tried again; a bus that dies is connected to again after a while. Owned by
// the orientation notifier, confined to the thread that uses it between maintain() and stop().
class SensorProxyClient {
 public:
  using TimePoint = std::chrono::steady_clock::time_point;

  // `report` is told the word each time the service says one.
  explicit SensorProxyClient(Function<void(const std::string& word)> report)
      : report_(std::move(report)) {}

  // Connects, or claims the sensor, when it is time to. A bus that is missing is logged once, and
  // again only after it had been there.
  void maintain();
  // Lets go of the sensor and of the bus.
  void stop();
  // What to wait for (a descriptor of -1 when there is nothing), and until when at most.
  pollfd pollEntry() const;
  std::optional<TimePoint> nextDue() const;
  // Handles what has arrived.
  void process();

 private:
  struct CloseBus {
    void operator()(sd_bus* bus) const;
  };

  void connect() REQUIRES(thread_);
  int subscribe() REQUIRES(thread_);
  void disconnect() REQUIRES(thread_);
  void claim() REQUIRES(thread_);
  void retryLater(std::chrono::milliseconds most) REQUIRES(thread_);
  void onClaimed(sd_bus_message* answer);
  void onProperty(sd_bus_message* answer);
  void onOwnerChanged(sd_bus_message* signal);
  void onPropertiesChanged(sd_bus_message* signal);
  void deviceIs(const std::string& word);

  const Function<void(const std::string&)> report_;
  ThreadChecker thread_;
  std::unique_ptr<sd_bus, CloseBus> bus_ GUARDED_BY(thread_);
  std::optional<TimePoint> retryAt_ GUARDED_BY(thread_);
  std::chrono::milliseconds backoff_ GUARDED_BY(thread_){0};
  bool saidBusIsMissing_ GUARDED_BY(thread_) = false;
};

}  // namespace vx::lnx
