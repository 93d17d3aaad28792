#include "client/ReportingClient.h"

#include <cstdlib>
#include <memory>
#include <utility>

#include "client/ServiceConnection.h"

namespace vx {

namespace {

using Code = ClientStatus::Code;
using wire::Operation;

constexpr const char* kDefaultSocket = "/run/vxreporting/service.socket";

// `arguments` writes that many items behind the operation.
template <class WriteArguments>
ClientStatus call(ServiceConnection& connection, Operation operation, std::size_t count,
                  const WriteArguments& arguments, CallAnswer answer) {
  if (!connection.acceptsCalls()) return connection.whyNoCalls();
  wire::FrameWriter frame = connection.beginCall(operation, count);
  arguments(frame.items());
  return connection.endCall(frame, std::move(answer));
}

ClientStatus callOnReporter(ServiceConnection& connection, Operation operation, int64_t reporterID,
                            CallAnswer answer) {
  return call(
      connection, operation, 1, [&](CborWriter& w) { w.integer(reporterID); }, std::move(answer));
}

// Makes the call and waits for its answer. The result lives on its own: patience may end before the
// answer comes, and a callback that runs meanwhile may destroy the client.
template <class T, class Call>
ClientResult<T> blocking(ServiceConnection& connection, std::chrono::milliseconds patience,
                         const Call& makeCall) {
  struct Waiting {
    bool answered = false;
    ClientResult<T> result;
  };
  const auto self = connection.shared_from_this();
  const auto waiting = std::make_shared<Waiting>();
  const ClientStatus taken = makeCall([waiting](const ClientResult<T>& result) {
    waiting->result = result;
    waiting->answered = true;
  });
  if (!taken.ok()) return {taken, {}};
  const ClientStatus status = connection.waitUntil([&] { return waiting->answered; }, patience);
  if (!waiting->answered) return {status, {}};
  return std::move(waiting->result);
}

}  // namespace

ReportingClient::ReportingClient() : ReportingClient(Options()) {}
ReportingClient::ReportingClient(const Options& options)
    : connection_(std::make_shared<ServiceConnection>(options)) {}
ReportingClient::~ReportingClient() { connection_->abandon(); }

ClientStatus ReportingClient::connect(std::string socketPath, std::chrono::milliseconds patience) {
  if (socketPath.empty()) {
    const char* named = std::getenv("VXREPORTING_SOCKET");
    socketPath = named != nullptr && *named != '\0' ? named : kDefaultSocket;
  }
  return connection_->open(socketPath, patience);
}

ClientStatus ReportingClient::adopt(int connectedFd, std::chrono::milliseconds patience) {
  return connection_->adopt(UniqueFd(connectedFd), patience);
}

ClientStatus ReportingClient::reconnect(std::chrono::milliseconds patience) {
  return connect(connection_->socketPath(), patience);
}

bool ReportingClient::isConnected() const { return connection_->isGreeted(); }
ClientStatus ReportingClient::status() const { return connection_->status(); }
std::optional<std::chrono::milliseconds> ReportingClient::retryIn() const {
  return connection_->retryIn();
}
ReportingClient::Counters ReportingClient::counters() const { return connection_->counters(); }
int ReportingClient::fd() const { return connection_->fd(); }
bool ReportingClient::wantsWrite() const { return connection_->wantsWrite(); }
std::size_t ReportingClient::pendingCalls() const { return connection_->pendingCalls(); }
uint64_t ReportingClient::unknownAnswers() const { return connection_->unknownAnswers(); }
ClientStatus ReportingClient::process() { return connection_->process(); }
ClientStatus ReportingClient::flush() { return connection_->flush(); }
ClientStatus ReportingClient::waitUntil(const Function<bool()>& condition,
                                        std::chrono::milliseconds patience) {
  return connection_->waitUntil(condition, patience);
}
ClientStatus ReportingClient::goodbye(std::chrono::milliseconds patience) {
  return connection_->sayGoodbye(patience);
}
void ReportingClient::disconnect() {
  connection_->disconnect({Code::Disconnected, "disconnected by the caller", "", 0});
}

// ---------------------------------------------------------------------------------------------------------------------
// Never blocking

ClientStatus ReportingClient::createReportingSessionAsync(int64_t reporterID, Callback<bool> done) {
  return callOnReporter(*connection_, Operation::CreateReportingSession, reporterID,
                        std::move(done));
}

ClientStatus ReportingClient::setServiceTypeAsync(uint16_t serviceType, int64_t reporterID,
                                                  Callback<bool> done) {
  return call(
      *connection_, Operation::SetServiceType, 2,
      [&](CborWriter& w) {
        w.integer(serviceType);
        w.integer(reporterID);
      },
      std::move(done));
}

ClientStatus ReportingClient::getServiceTypeAsync(int64_t reporterID, Callback<uint16_t> done) {
  return callOnReporter(*connection_, Operation::GetServiceNameForReporterID, reporterID,
                        std::move(done));
}

ClientStatus ReportingClient::setConfigurationAsync(const Payload& configuration,
                                                    int64_t reporterID, Callback<bool> done) {
  return call(
      *connection_, Operation::SetConfiguration, 2,
      [&](CborWriter& w) {
        w.encoded(configuration.encoded());
        w.integer(reporterID);
      },
      std::move(done));
}

ClientStatus ReportingClient::startReportingSession(int64_t reporterID, Callback<bool> done) {
  return callOnReporter(*connection_, Operation::StartReportingSessionForID, reporterID,
                        std::move(done));
}

ClientStatus ReportingClient::sendMessageAsync(const Payload& message, uint32_t category,
                                               uint16_t type, Callback<Done> done) {
  return call(
      *connection_, Operation::SendMessage, 4,
      [&](CborWriter& w) {
        w.encoded(message.encoded());
        w.unsignedInteger(category);
        w.unsignedInteger(type);
        w.null();
      },
      std::move(done));
}

ClientStatus ReportingClient::sendMessageAsync(const Payload& message, uint32_t category,
                                               uint16_t type,
                                               const std::vector<int64_t>& reporterIDs,
                                               Callback<Done> done) {
  return call(
      *connection_, Operation::SendMessage, 4,
      [&](CborWriter& w) {
        w.encoded(message.encoded());
        w.unsignedInteger(category);
        w.unsignedInteger(type);
        w.array(reporterIDs.size());
        for (const int64_t id : reporterIDs) w.integer(id);
      },
      std::move(done));
}

ClientStatus ReportingClient::stopReportingSessionAsync(int64_t reporterID, Callback<bool> done) {
  return callOnReporter(*connection_, Operation::StopReportingSessionForID, reporterID,
                        std::move(done));
}

ClientStatus ReportingClient::destroyReportingSessionAsync(int64_t reporterID,
                                                           Callback<bool> done) {
  return callOnReporter(*connection_, Operation::DestroyReportingSession, reporterID,
                        std::move(done));
}

ClientStatus ReportingClient::validateReporterAsync(int64_t reporterID,
                                                    Callback<ReporterValidation> done) {
  return callOnReporter(*connection_, Operation::ReporterID, reporterID, std::move(done));
}

ClientStatus ReportingClient::getAllReportersAsync(Callback<std::vector<int64_t>> done) {
  return call(
      *connection_, Operation::GetAllReporters, 0, [](CborWriter&) {}, std::move(done));
}

// ---------------------------------------------------------------------------------------------------------------------
// Blocking

ClientStatus ReportingClient::killService(std::chrono::milliseconds patience) {
  bool sent = false;
  const ClientResult<bool> ended = blocking<bool>(*connection_, patience, [&](Callback<bool> done) {
    const ClientStatus taken = call(
        *connection_, Operation::KillService, 0, [](CborWriter&) {}, std::move(done));
    ClientStatus written = taken.ok() ? flush() : taken;
    sent = written.ok();
    return written;
  });
  return sent && ended.status.code == Code::Disconnected ? ClientStatus() : ended.status;
}

ClientResult<bool> ReportingClient::createReportingSession(int64_t reporterID,
                                                           std::chrono::milliseconds patience) {
  return blocking<bool>(*connection_, patience, [&](Callback<bool> done) {
    return createReportingSessionAsync(reporterID, std::move(done));
  });
}

ClientResult<bool> ReportingClient::setServiceType(uint16_t serviceType, int64_t reporterID,
                                                   std::chrono::milliseconds patience) {
  return blocking<bool>(*connection_, patience, [&](Callback<bool> done) {
    return setServiceTypeAsync(serviceType, reporterID, std::move(done));
  });
}

ClientResult<uint16_t> ReportingClient::getServiceType(int64_t reporterID,
                                                       std::chrono::milliseconds patience) {
  return blocking<uint16_t>(*connection_, patience, [&](Callback<uint16_t> done) {
    return getServiceTypeAsync(reporterID, std::move(done));
  });
}

ClientResult<bool> ReportingClient::setConfiguration(const Payload& configuration,
                                                     int64_t reporterID,
                                                     std::chrono::milliseconds patience) {
  return blocking<bool>(*connection_, patience, [&](Callback<bool> done) {
    return setConfigurationAsync(configuration, reporterID, std::move(done));
  });
}

ClientStatus ReportingClient::sendMessage(const Payload& message, uint32_t category, uint16_t type,
                                          std::chrono::milliseconds patience) {
  return blocking<Done>(*connection_, patience,
                        [&](Callback<Done> done) {
                          return sendMessageAsync(message, category, type, std::move(done));
                        })
      .status;
}

ClientStatus ReportingClient::sendMessage(const Payload& message, uint32_t category, uint16_t type,
                                          const std::vector<int64_t>& reporterIDs,
                                          std::chrono::milliseconds patience) {
  return blocking<Done>(*connection_, patience,
                        [&](Callback<Done> done) {
                          return sendMessageAsync(message, category, type, reporterIDs,
                                                  std::move(done));
                        })
      .status;
}

ClientResult<bool> ReportingClient::stopReportingSession(int64_t reporterID,
                                                         std::chrono::milliseconds patience) {
  return blocking<bool>(*connection_, patience, [&](Callback<bool> done) {
    return stopReportingSessionAsync(reporterID, std::move(done));
  });
}

ClientResult<bool> ReportingClient::destroyReportingSession(int64_t reporterID,
                                                            std::chrono::milliseconds patience) {
  return blocking<bool>(*connection_, patience, [&](Callback<bool> done) {
    return destroyReportingSessionAsync(reporterID, std::move(done));
  });
}

ClientResult<ReporterValidation> ReportingClient::validateReporter(
    int64_t reporterID, std::chrono::milliseconds patience) {
  return blocking<ReporterValidation>(*connection_, patience,
                                      [&](Callback<ReporterValidation> done) {
                                        return validateReporterAsync(reporterID, std::move(done));
                                      });
}

ClientResult<std::vector<int64_t>> ReportingClient::getAllReporters(
    std::chrono::milliseconds patience) {
  return blocking<std::vector<int64_t>>(
      *connection_, patience,
      [&](Callback<std::vector<int64_t>> done) { return getAllReportersAsync(std::move(done)); });
}

}  // namespace vx
