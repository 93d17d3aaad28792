#include "platform/linux/RelayReporting.h"

#include <sys/random.h>

#include <array>
#include <utility>
#include <variant>

#include "base/Mutex.h"

namespace vx::lnx {

namespace {

struct HierarchyToken final : VyrSecureHierarchyToken {
  std::array<uint8_t, 16> bytes{};
  std::array<uint8_t, 16> parent{};  // zeros: none
};

Error noBackend() {
  return {kRelayErrorDomain, kRelayErrorNoBackend, "no relay back end is configured"};
}

int64_t sessionIDOf(const VyrSessionInfo& info) {
  for (const auto& [key, value] : info) {
    if (key != kVyrReportingSessionInfoSessionID) continue;
    if (const auto* id = std::get_if<int64_t>(&value)) return *id;
  }
  return 0;
}

// Told by each back end; tells the handler when all have. Thread-safe; owned by those that have not
// told yet.
class FlushOfAll {
 public:
  FlushOfAll(std::size_t backends, Function<void(std::optional<Error>)> handler)
      : waiting_(backends), handler_(std::move(handler)) {}
  void onFlushed(std::optional<Error> error) {
    {
      MutexLock lock(mutex_);
      if (!firstError_) firstError_ = std::move(error);
      if (--waiting_ > 0) return;
    }
    if (handler_) handler_(firstError());
  }

 private:
  std::optional<Error> firstError() {
    MutexLock lock(mutex_);
    return firstError_;
  }
  Mutex mutex_;
  std::size_t waiting_ GUARDED_BY(mutex_);
  std::optional<Error> firstError_ GUARDED_BY(mutex_);
  const Function<void(std::optional<Error>)> handler_;
};

}  // namespace

// Owned by whoever made it. Thread-safe: immutable.
class RelayReporting::Session final : public VyrReportingSession {
 public:
  Session(const RelayReporting& reporting, const VyrSessionInfo& info, const Payload& userInfo)
      : reporting_(reporting), sessionID_(sessionIDOf(info)) {
    for (RelayBackend* backend : reporting.backends_)
      sessions_.push_back(backend->open(info, userInfo));
  }

  std::string description() const override {
    return "<VyrReportingSession " + std::to_string(sessionID_) + ">";
  }

  void startConfigurationWithCompletionHandler(
      Function<void(std::optional<BackendList>)> handler) override {
    BackendList names;
    for (const RelayBackend* backend : reporting_.backends_) names.emplace_back(backend->name());
    reporting_.runSoon_([names = std::move(names), handler = std::move(handler)] {
      handler(names.empty() ? std::nullopt : std::optional<BackendList>(names));
    });
  }

  bool sendMessageWithCategory(uint16_t category, uint16_t type, const Payload& payload,
                               std::optional<Error>& error) override {
    std::optional<Error> failure;
    if (sessions_.empty()) failure = noBackend();
    for (const auto& session : sessions_) {
      std::optional<Error> refused = session->send(category, type, payload);
      if (!failure) failure = std::move(refused);
    }
    if (!failure) return true;
    error = std::move(failure);
    return false;
  }

  void flushMessagesWithCompletion(Function<void(std::optional<Error>)> handler) override {
    if (sessions_.empty()) {  // nothing was taken that could be on its way
      if (handler) handler(std::nullopt);
      return;
    }
    const auto all = std::make_shared<FlushOfAll>(sessions_.size(), std::move(handler));
    for (const auto& session : sessions_)
      session->flush([all](std::optional<Error> error) { all->onFlushed(std::move(error)); });
  }

  std::shared_ptr<const std::atomic<uint64_t>> storedMessages() const override {
    return sessions_.empty() ? nullptr : sessions_.front()->storedMessages();
  }

 private:
  const RelayReporting& reporting_;
  const int64_t sessionID_;
  std::vector<std::unique_ptr<RelayBackend::Session>> sessions_;  // one per back end
};

RelayReporting::RelayReporting(std::vector<RelayBackend*> backends, RunSoon runSoon)
    : backends_(std::move(backends)), runSoon_(std::move(runSoon)) {}

std::shared_ptr<const VyrSecureHierarchyToken>
RelayReporting::newSecureHierarchyTokenFromParentToken(const VyrSecureHierarchyToken* parent) {
  auto token = std::make_shared<HierarchyToken>();
  if (getrandom(token->bytes.data(), token->bytes.size(), 0) < 0) token->bytes = {};
  if (const auto* known = dynamic_cast<const HierarchyToken*>(parent)) token->parent = known->bytes;
  return token;
}

std::shared_ptr<VyrReportingSession> RelayReporting::initWithSessionInfo(
    const VyrSessionInfo& sessionInfo, const Payload& userInfo, const std::vector<std::string>&) {
  return std::make_shared<Session>(*this, sessionInfo, userInfo);
}

bool RelayReporting::sendOneMessageWithSessionInfo(const VyrSessionInfo& sessionInfo,
                                                   const Payload& userInfo, uint16_t category,
                                                   uint16_t type, const Payload& payload,
                                                   std::optional<Error>& error) {
  std::optional<Error> failure;
  if (backends_.empty()) failure = noBackend();
  for (RelayBackend* backend : backends_) {
    std::optional<Error> refused = backend->sendOne(sessionInfo, userInfo, category, type, payload);
    if (!failure) failure = std::move(refused);
  }
  if (!failure) return true;
  error = std::move(failure);
  return false;
}

}  // namespace vx::lnx
