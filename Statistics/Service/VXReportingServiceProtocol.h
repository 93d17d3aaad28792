// What a client may call over its connection.
#pragma once

#include <memory>
#include <optional>
#include <vector>

#include "Statistics/VXReportingUtility.h"
#include "base/Error.h"
#include "base/Function.h"
#include "platform/ClientConnection.h"

namespace vx {

// The operations, in declaration order. Each runs its front half on the connection's own queue,
// moves its work onto the service queue and answers through its reply there. A reply may be invoked
// never, once or (getServiceNameForReporterID of 0) twice.
class VXReportingServiceProtocol : public ExportedObject {
 public:
  using BooleanReply = Function<void(bool)>;
  using ServiceTypeReply = Function<void(ServiceType)>;
  using ErrorReply = Function<void(const std::optional<Error>&)>;
  using DictionaryReply = Function<void(const Payload&)>;
  using NumbersReply = Function<void(const std::vector<ReporterID>&)>;

  virtual void createReportingSession(ReporterID reporterID, BooleanReply reply) = 0;
  virtual void setServiceType(ServiceType type, ReporterID reporterID, BooleanReply reply) = 0;
  virtual void getServiceNameForReporterID(ReporterID reporterID, ServiceTypeReply reply) = 0;
  virtual void setConfiguration(std::optional<Payload> configuration, ReporterID reporterID,
                                BooleanReply reply) = 0;
  virtual void startReportingSessionForID(ReporterID reporterID, BooleanReply reply) = 0;
  virtual void sendMessage(Payload message, MessageCategory category, MessageType type,
                           std::optional<std::vector<ReporterID>> reportingIDs,
                           ErrorReply reply) = 0;
  virtual void stopReportingSessionForID(ReporterID reporterID, BooleanReply reply) = 0;
  virtual void destroyReportingSession(ReporterID reporterID, BooleanReply reply) = 0;
  virtual void reporterID(ReporterID reporterID, DictionaryReply reply) = 0;  // validation
  virtual void getAllReporters(NumbersReply reply) = 0;
  virtual void killService(BooleanReply reply) = 0;
};

// The description that connections are given. The exported object must be a
// VXReportingServiceProtocol.
const InterfaceDescription& vxReportingServiceInterface();

}  // namespace vx
