// The server instance: front halves, and the work of every operation but routing.
#include <algorithm>
#include <utility>

#include "Statistics/Service/VXReportingServiceDelegate.h"
#include "platform/Log.h"

namespace vx {

namespace {

constexpr uint32_t kTraceCreate = 0x21042814;
constexpr uint32_t kTraceDestroy = 0x21042820;
constexpr int kExitStatusOfKill = 2;
constexpr std::string_view kSavedStart = "start";
constexpr std::string_view kSavedName = "name";

long long ll(ReporterID reporterID) { return static_cast<long long>(reporterID); }

}  // namespace

VXReportingServerInstance::VXReportingServerInstance(
    int32_t processIdentifier, std::weak_ptr<VXReportingServiceDelegateProtocol> delegate)
    : processIdentifier_(processIdentifier), delegate_(std::move(delegate)) {}

std::shared_ptr<VXReportingServerInstance> VXReportingServerInstance::initWithPID(
    int32_t processIdentifier, std::weak_ptr<VXReportingServiceDelegateProtocol> delegate) {
  VX_LOG(serverLogScope(), Default, "new client with pid %lu",
         static_cast<unsigned long>(processIdentifier));
  return std::shared_ptr<VXReportingServerInstance>(
      new VXReportingServerInstance(processIdentifier, std::move(delegate)));
}

VXReportingServerInstance::~VXReportingServerInstance() {
  VX_LOG_AS("dealloc", serverLogScope(), Default, "dealloc %i from the server client list",
            processIdentifier_);
}

const VXReportingServerInstance::SessionMap& VXReportingServerInstance::clientReportingSessionMap()
    const {
  serviceQueue()->assertIsCurrent();
  return clientReportingSessionMap_;
}

std::optional<Date> VXReportingServerInstance::clientStartDate() const {
  MutexLock lock(registrationMutex_);
  return clientStartDate_;
}

std::optional<std::string> VXReportingServerInstance::clientProcessName() const {
  MutexLock lock(registrationMutex_);
  return clientProcessName_;
}

void VXReportingServerInstance::setRegistration(Date startDate,
                                                std::optional<std::string> processName) {
  MutexLock lock(registrationMutex_);
  clientStartDate_ = startDate;
  clientProcessName_ = std::move(processName);
}

void VXReportingServerInstance::joinIndex(std::shared_ptr<VXReportingReporterIndex> index,
                                          uint64_t registration) {
  serviceQueue()->assertIsCurrent();
  index_ = std::move(index);
  registration_ = registration;
}

void VXReportingServerInstance::leaveIndex() {
  serviceQueue()->assertIsCurrent();
  const auto index = std::move(index_);
  if (index == nullptr) return;
  for (const auto& [reporterID, session] : clientReportingSessionMap_)
    index->remove(reporterID, registration_);
}

void VXReportingServerInstance::keepSession(ReporterID reporterID,
                                            std::shared_ptr<VXReportingSession> session) {
  clientReportingSessionMap_[reporterID] = std::move(session);
  if (index_ != nullptr) index_->add(reporterID, registration_, *this);
}

std::shared_ptr<VXReportingSession> VXReportingServerInstance::findReportingSessionForID(
    ReporterID reporterID, Lookup lookup) {
  serviceQueue()->assertIsCurrent();
  const auto found = clientReportingSessionMap_.find(reporterID);
  if (found != clientReportingSessionMap_.end()) return found->second;
  if (lookup == Lookup::OwnMap) return nullptr;
  const auto delegate = delegate_.lock();
  return delegate != nullptr ? delegate->findReportingSessionForID(reporterID) : nullptr;
}

// ---------------------------------------------------------------------------------------------------------------------
// Saved and restored

SavedClient VXReportingServerInstance::savedState(bool& complete) {
  serviceQueue()->assertIsCurrent();
  SavedClient saved;
  saved.object = this;
  PayloadBuilder facts;
  if (const std::optional<Date> start = clientStartDate()) {
    facts.set(kSavedStart, PayloadDate{secondsSince1970(*start)});
  }
  if (const std::optional<std::string> name = clientProcessName()) facts.set(kSavedName, *name);
  saved.facts = facts.build();
  for (const auto& [reporterID, session] : clientReportingSessionMap_)
    saved.sessions.push_back(session->savedState(complete));
  return saved;
}

bool VXReportingServerInstance::restore(const Payload& facts) {
  const std::optional<Value> start = facts.find(kSavedStart);
  const std::optional<Value> name = facts.find(kSavedName);
  if (!start || start->kind() != ValueKind::Date) return false;
  setRegistration(dateFromSeconds(start->asDouble()),
                  name ? std::optional(std::string(name->asString())) : std::nullopt);
  return true;
}

bool VXReportingServerInstance::restoreSession(ReporterID reporterID, const Payload& facts,
                                               const Payload& information) {
  bool whole = true;
  auto found = clientReportingSessionMap_.find(reporterID);
  if (found == clientReportingSessionMap_.end()) {
    auto session = VXReportingSession::restored(reporterID, {processIdentifier_}, facts, whole);
    if (session == nullptr) return false;
    keepSession(reporterID, std::move(session));
    found = clientReportingSessionMap_.find(reporterID);
  }
  found->second->restoreInformation(information);
  return whole;
}

bool VXReportingServerInstance::restoreRelay(ReporterID reporterID) {
  const auto found = clientReportingSessionMap_.find(reporterID);
  if (found == clientReportingSessionMap_.end()) return false;
  found->second->restoreRelay();
  return true;
}

// ---------------------------------------------------------------------------------------------------------------------
// Operations

void VXReportingServerInstance::createReportingSession(ReporterID reporterID, BooleanReply reply) {
  VX_VERBOSE(serverLogScope(), "creating session for reporter %lli", ll(reporterID));
  serviceQueue()->async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    platform().trace.emit(kTraceCreate, 0, 0, 0, 0);
    self->createSession(reporterID);
    reply(true);
  });
}

void VXReportingServerInstance::createSession(ReporterID reporterID) {
  serviceQueue()->assertIsCurrent();
  // A session that is there already is dropped without being stopped.
  keepSession(reporterID, VXReportingSession::initWithID(reporterID, {processIdentifier_}));
  VX_LOG_AS("createReportingSession", serverLogScope(), Default,
            "session created for reporter %lli", ll(reporterID));
}

void VXReportingServerInstance::setServiceType(ServiceType type, ReporterID reporterID,
                                               BooleanReply reply) {
  VX_VERBOSE(serverLogScope(), "setting service type %i for reporter %lli", int{type},
             ll(reporterID));
  serviceQueue()->async([self = shared_from_this(), type, reporterID, reply = std::move(reply)] {
    if (reporterID == 0) return reply(true);
    if (const auto session = self->findReportingSessionForID(reporterID, Lookup::OwnMap)) {
      session->setServiceType(type);
      VX_LOG_AS("setServiceType", serverLogScope(), Default,
                "service type %i set for reporter  %lli", int{type}, ll(reporterID));
    }
    reply(true);
  });
}

void VXReportingServerInstance::getServiceNameForReporterID(ReporterID reporterID,
                                                            ServiceTypeReply reply) {
  VX_VERBOSE(serverLogScope(), "fetching seviceType");
  serviceQueue()->async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    if (reporterID == 0) reply(kServiceTypeUnknown);  // and on: 0 is answered twice
    const auto session = self->findReportingSessionForID(reporterID, Lookup::AcrossAllClients);
    const ServiceType type = session != nullptr ? session->serviceType() : kServiceTypeUnknown;
    reply(type);
    VX_LOG_AS("getServiceNameForReporterID", serverLogScope(), Default,
              "returnning service type %i for reporter  %lli", int{type}, ll(reporterID));
  });
}

void VXReportingServerInstance::setConfiguration(std::optional<Payload> configuration,
                                                 ReporterID reporterID, BooleanReply reply) {
  VX_VERBOSE(serverLogScope(), "setting configuration");
  serviceQueue()->async([self = shared_from_this(), configuration = std::move(configuration),
                         reporterID, reply = std::move(reply)] {
    if (const auto session = self->findReportingSessionForID(reporterID, Lookup::OwnMap)) {
      if (!session->setConfiguration(configuration)) return;  // the answer is that there is none
    }
    reply(true);
  });
}

void VXReportingServerInstance::startReportingSessionForID(ReporterID reporterID,
                                                           BooleanReply reply) {
  VX_VERBOSE(serverLogScope(), "starting session for reporter %lli", ll(reporterID));
  serviceQueue()->async(
      [self = shared_from_this(), reporterID, reply = std::move(reply)]() mutable {
        self->startSession(reporterID, std::move(reply));
      });
}

void VXReportingServerInstance::stopReportingSessionForID(ReporterID reporterID,
                                                          BooleanReply reply) {
  VX_VERBOSE(serverLogScope(), "stopping session for reporter %lli", ll(reporterID));
  serviceQueue()->async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    self->stopSession(reporterID);
    reply(true);
  });
}

void VXReportingServerInstance::destroyReportingSession(ReporterID reporterID, BooleanReply reply) {
  VX_VERBOSE(serverLogScope(), "destroying session for reporter %lli", ll(reporterID));
  serviceQueue()->async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    platform().trace.emit(kTraceDestroy, 0, 0, 0, 0);
    if (reporterID != 0) self->destroySession(reporterID);
    reply(true);
  });
}

void VXReportingServerInstance::destroySession(ReporterID reporterID) {
  serviceQueue()->assertIsCurrent();
  const auto found = clientReportingSessionMap_.find(reporterID);
  if (found != clientReportingSessionMap_.end()) {
    if (found->second->started()) found->second->stop();
    clientReportingSessionMap_.erase(found);
    if (index_ != nullptr) index_->remove(reporterID, registration_);
  }
  VX_LOG_AS("destroyReportingSession", serverLogScope(), Default, "destroying %lli",
            ll(reporterID));
}

void VXReportingServerInstance::reporterID(ReporterID reporterID, DictionaryReply reply) {
  VX_VERBOSE(serverLogScope(), "validating reporter %lli", ll(reporterID));
  serviceQueue()->async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    PayloadBuilder answer;
    answer.set("reporterID", int64_t{0}).set("serviceType", kServiceTypeUnknown);
    if (const auto session =
            self->findReportingSessionForID(reporterID, Lookup::AcrossAllClients)) {
      answer.set("reporterID", reporterID).set("serviceType", session->serviceType());
    }
    VX_LOG_AS("reporterID", serverLogScope(), Default, "validating reporter %lli", ll(reporterID));
    reply(answer.build());
  });
}

void VXReportingServerInstance::getAllReporters(NumbersReply reply) {
  serviceQueue()->async([self = shared_from_this(), reply = std::move(reply)] {
    std::vector<ReporterID> reporters;
    if (const auto delegate = self->delegate_.lock()) {
      for (const auto& client : delegate->getAllClients()) {
        for (const auto& [reporterID, session] : client->clientReportingSessionMap_)
          reporters.push_back(reporterID);
      }
    }
    reply(reporters);
  });
}

void VXReportingServerInstance::killService(BooleanReply) {
  VX_LOG(serverLogScope(), Default, "DESTROYING SERVICE");
  platform().processControl.exit(kExitStatusOfKill);
}

// A thousand stops take their time, and others do not wait for all of them. So that nobody sees a
// client half stopped, or sends to what is left of it, it leaves the list before the first.
void VXReportingServerInstance::handleConnectionError() {
  serviceQueue()->asyncInSteps(
      [self = shared_from_this(), next = std::optional<SessionMap::iterator>()]() mutable {
        if (!next && !self->leaveClients()) return false;
        if (!next) next = self->clientReportingSessionMap_.begin();
        return self->stopNext(*next);
      });
}

// False: it has left already.
bool VXReportingServerInstance::leaveClients() {
  const auto delegate = delegate_.lock();
  if (delegate == nullptr) return false;
  const auto& clients = delegate->getAllClients();
  if (std::ranges::find(clients, shared_from_this()) == clients.end()) return false;
  delegate->removeClient(shared_from_this());
  return true;
}

// Stops the first started session from there on, in map order; false when there is none left.
bool VXReportingServerInstance::stopNext(SessionMap::iterator& next) {
  serviceQueue()->assertIsCurrent();
  const auto end = clientReportingSessionMap_.end();
  while (next != end && !next->second->started()) ++next;
  if (next != end) {
    const auto session = next++;
    session->second->stop();
    return true;
  }
  VX_LOG_AS("handleConnectionError", serverLogScope(), Default,
            "removing %i from the server client list", processIdentifier_);
  return false;
}

}  // namespace vx
