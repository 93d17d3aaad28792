// The work of the three operations that move messages: send, start and stop.
#include <utility>

#include "Statistics/Service/VXReportingServiceDelegate.h"
#include "Statistics/VXReportingTallyhubBridge.h"
#include "Statistics/VXReportingWattmarkUtility.h"
#include "platform/Log.h"

namespace vx {

namespace {

constexpr uint32_t kTraceStart = 0x21042818;
constexpr uint32_t kTraceStop = 0x2104281C;
constexpr uint32_t kTraceSend = 0x21042824;

using Fate = VXReportingActivity::Fate;

const Error& reportingIsOff() {
  static const Error error{"com.quorvel.audio.reporting", 1, ""};
  return error;
}

std::string idsText(const std::optional<std::vector<ReporterID>>& ids) {
  if (!ids) return "(null)";
  std::string text = "(";
  for (const ReporterID id : *ids) text += (text.size() > 1 ? ", " : "") + std::to_string(id);
  return text + ")";
}

std::string sessionsText(const VXReportingServerInstance::SessionMap& sessions) {
  std::string text = "(";
  for (const auto& [id, session] : sessions)
    text += (text.size() > 1 ? ", " : "") + session->description();
  return text + ")";
}

std::string sessionsText(const std::vector<VXReportingSession*>& sessions) {
  std::string text = "(";
  for (const VXReportingSession* session : sessions)
    text += (text.size() > 1 ? ", " : "") + session->description();
  return text + ")";
}

}  // namespace

void VXReportingServerInstance::sendMessage(Payload message, MessageCategory category,
                                            MessageType type,
                                            std::optional<std::vector<ReporterID>> reportingIDs,
                                            ErrorReply reply) {
  VX_VERBOSE(serverLogScope(), "sending message for reporter %s", idsText(reportingIDs).c_str());
  serviceQueue()->async([self = shared_from_this(), message = std::move(message), category, type,
                         ids = std::move(reportingIDs), reply = std::move(reply)] {
    platform().trace.emit(kTraceSend, 0, 0, 0, 0);
    self->routeMessage(message, category, type, ids, reply);
  });
}

void VXReportingServerInstance::routeMessage(
    const Payload& message, MessageCategory category, MessageType type,
    const std::optional<std::vector<ReporterID>>& reportingIDs, const ErrorReply& reply) {
  serviceQueue()->assertIsCurrent();
  const auto delegate = delegate_.lock();
  if (delegate == nullptr) return reply(reportingIsOff());
  if (!delegate->isReportingEnabled()) {
    delegate->activity().routed(Fate::ReportingOff, message, category, type, 0, nullptr);
    return reply(reportingIsOff());
  }
  if (reportingIDs)
    routeToListed(*delegate, message, category, type, *reportingIDs);
  else
    routeToStarted(*delegate, message, category, type);
  reply(std::nullopt);
}

// Sessions are served last here and first on the other path; both orders are meant. A session need
// not be started.
void VXReportingServerInstance::routeToListed(VXReportingServiceDelegateProtocol& delegate,
                                              const Payload& message, MessageCategory category,
                                              MessageType type,
                                              const std::vector<ReporterID>& reportingIDs) {
  for (const ReporterID id : reportingIDs) {
    if (id == 0) continue;
    const auto session = findReportingSessionForID(id, Lookup::AcrossAllClients);
    delegate.activity().routed(session != nullptr ? Fate::Delivered : Fate::UnknownSession, message,
                               category, type, id, session.get());
    if (session == nullptr) continue;
    VXReportingTallyhubBridge::handleEvent(&message, category, type, session.get());
    VXReportingWattmarkUtility::handleEvent(&message, category, type, session.get());
    session->sendMessage(message, category, type, nullptr);
  }
}

void VXReportingServerInstance::routeToStarted(VXReportingServiceDelegateProtocol& delegate,
                                               const Payload& message, MessageCategory category,
                                               MessageType type) {
  static constexpr const char* kFunction = "sendMessage";
  // Nobody else changes the session maps while this work runs.
  std::vector<VXReportingSession*>& active = activeSessions_;
  active.clear();
  for (const auto& client : delegate.getAllClients()) {
    VX_LOG_AS(kFunction, serverLogScope(), Default, "sessions for client %i : %s",
              client->processIdentifier(),
              sessionsText(client->clientReportingSessionMap_).c_str());
    for (const auto& [id, session] : client->clientReportingSessionMap_) {
      if (session->started()) active.push_back(session.get());
    }
  }
  VX_LOG_AS(kFunction, serverLogScope(), Default, "active reporting sessions %lu : %s",
            static_cast<unsigned long>(active.size()), sessionsText(active).c_str());
  for (VXReportingSession* session : active) {
    delegate.activity().routed(Fate::Delivered, message, category, type, session->reporterID(),
                               session);
    session->sendMessage(message, category, type, nullptr);
    VXReportingTallyhubBridge::handleEvent(&message, category, type, session);
    VXReportingWattmarkUtility::handleEvent(&message, category, type, session);
  }
  const bool delivered = !active.empty();
  active.clear();
  if (delivered) return;
  VX_LOG_AS(kFunction, serverLogScope(), Default,
            "no active reporting sessions found, sending as standalone");
  delegate.activity().routed(Fate::Standalone, message, category, type, 0, nullptr);
  VXReportingWattmarkUtility::handleEvent(&message, category, type, nullptr);
  VXReportingSession::sendSingleMessage(message, category, type, kServiceTypeStandalone,
                                        delegate.getDefaults(), nullptr);
}

void VXReportingServerInstance::startSession(ReporterID reporterID, BooleanReply reply) {
  serviceQueue()->assertIsCurrent();
  platform().trace.emit(kTraceStart, 0, 0, 0, 0);
  if (reporterID == 0) return reply(true);
  const auto session = findReportingSessionForID(reporterID, Lookup::AcrossAllClients);
  if (session == nullptr || session->started()) return reply(true);
  session->start();
  const auto delegate = delegate_.lock();
  session->setDriverSnapShot(delegate != nullptr ? delegate->getSnapShot() : nullptr);
  // A reply held since an earlier start whose stop did not release it.
  if (const auto held = session->takeTransactionCompleteBlock()) held(true);
  session->setTransactionCompleteBlock(std::move(reply));
}

void VXReportingServerInstance::stopSession(ReporterID reporterID) {
  serviceQueue()->assertIsCurrent();
  static constexpr const char* kFunction = "stopReportingSessionForID";
  platform().trace.emit(kTraceStop, 0, 0, 0, 0);
  if (reporterID == 0) return;
  if (const auto session = findReportingSessionForID(reporterID, Lookup::OwnMap)) {
    const auto delegate = delegate_.lock();
    const std::optional<Payload> statistics =
        delegate != nullptr
            ? delegate->getDriverStatisticsRelativeToSnapShot(session->driverSnapShot())
            : std::nullopt;
    if (statistics) {
      delegate->activity().routed(Fate::Drivers, *statistics, kCategoryChannelReporting,
                                  kMessageTypeGeneric, reporterID, session.get());
      session->sendMessage(*statistics, kCategoryChannelReporting, kMessageTypeGeneric, nullptr);
      VXReportingTallyhubBridge::handleEvent(&*statistics, kCategoryChannelReporting,
                                             kMessageTypeGeneric, session.get());
      VX_LOG_AS(kFunction, serverLogScope(), Default, "fetching driver logs %s",
                statistics->text().c_str());
    } else {
      VX_LOG_AS(kFunction, serverLogScope(), Default,
                "nothing interesting to fetch from the drivers");
    }
    session->setDriverSnapShot(nullptr);
    session->stop();
    if (const auto held = session->takeTransactionCompleteBlock()) held(true);
  }
  VX_LOG_AS(kFunction, serverLogScope(), Default, "stopping %lli",
            static_cast<long long>(reporterID));
}

}  // namespace vx
