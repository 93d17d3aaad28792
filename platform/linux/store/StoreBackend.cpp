#include "platform/linux/store/StoreBackend.h"

#include <utility>

namespace vx::lnx {

namespace {

constexpr std::size_t kTypicalSessionInfoBytes = 256;

Error closed() { return {kRelayErrorDomain, kRelayErrorClosed, "the store is closed"}; }

// One relay session of the store. Thread-safe: the row it stands for is the writer's.
class StoreSession final : public RelayBackend::Session {
 public:
  explicit StoreSession(StoreQueue& queue) : queue_(queue), row_(std::make_shared<RelayRow>()) {}

  std::optional<Error> open(const VyrSessionInfo& info, const Payload& userInfo) {
    VyrSessionInfo kept = info;
    std::erase_if(kept, [](const auto& entry) {
      return entry.first == kVyrReportingSessionInfoHierarchyToken;
    });
    row_->information =
        std::make_unique<std::pair<VyrSessionInfo, Payload>>(std::move(kept), userInfo);
    return append(RelayOpenRecord{row_}, userInfo.encoded().size() + kTypicalSessionInfoBytes);
  }

  std::optional<Error> send(uint16_t category, uint16_t type, const Payload& payload) override {
    return append(RelayMessageRecord{row_, payload, category, type}, payload.encoded().size());
  }

  void flush(Function<void(std::optional<Error>)> handler) override {
    // Flushed when it ends, and only then.
    (void)queue_.append(RelayEndRecord{row_}, 0);
    if (!queue_.appendFlush(handler, row_)) handler(closed());
  }

  std::shared_ptr<const std::atomic<uint64_t>> storedMessages() const override {
    return {row_, &row_->messagesCommitted};
  }

 private:
  std::optional<Error> append(StoreRecord::What what, std::size_t bytes) {
    if (queue_.append(std::move(what), bytes)) return std::nullopt;
    return closed();
  }

  StoreQueue& queue_;
  const std::shared_ptr<RelayRow> row_;
};

}  // namespace

std::unique_ptr<RelayBackend::Session> StoreBackend::open(const VyrSessionInfo& info,
                                                          const Payload& userInfo) {
  auto session = std::make_unique<StoreSession>(queue_);
  (void)session->open(info, userInfo);  // told by whatever is sent afterwards
  return session;
}

std::optional<Error> StoreBackend::sendOne(const VyrSessionInfo& info, const Payload& userInfo,
                                           uint16_t category, uint16_t type,
                                           const Payload& payload) {
  StoreSession session(queue_);
  if (std::optional<Error> refused = session.open(info, userInfo)) return refused;
  return session.send(category, type, payload);
}

}  // namespace vx::lnx
