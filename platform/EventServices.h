// The platform's analytics service and its power event log.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string_view>

#include "base/Function.h"
#include "propertylist/Payload.h"

namespace vx {

class AnalyticsEventService {
 public:
  virtual ~AnalyticsEventService() = default;
  // The builder is called only if the service wants the event, possibly later and on another
  // thread. `name` stays where it is as long as the process lives. `message`: what the builder's
  // dictionary will begin with, if that is a message that travels elsewhere too (empty otherwise);
  // a hint for a service that would keep the common part once. `holds`: bytes that the builder
  // keeps besides.
  virtual void sendEventLazy(std::string_view name, Function<Payload()> builder,
                             const Payload& message, std::size_t holds) = 0;
};

class PowerEventLog {
 public:
  virtual ~PowerEventLog() = default;
  // Records a named event. `options` may be null.
  virtual void logRegisteredEvent(int64_t clientIdentifier, std::string_view eventName,
                                  const Payload& record, const Payload* options) = 0;
};

}  // namespace vx
