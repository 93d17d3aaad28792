// The client library: reports into the audio-telemetry service from any process.
//
//   vx::ReportingClient client;
//   if (!client.connect().ok()) return;  // no reporting; nothing else changes
//   client.createReportingSession(42);
//   client.setServiceType(7, 42);
//   client.startReportingSession(42, [](const auto&) {});  // answered when the session stops
//   client.sendMessage(vx::PayloadBuilder().set("gain", 0.5).build(), 0x08000005, 1);
//   client.stopReportingSession(42);
//
// No threads of its own, never blocks unless asked to, never aborts the caller, whatever the daemon
// does.
//
// Sessions that outlive the connection (Options::keepSessions). From connect() on, whether it
// succeeded or not, until goodbye(), disconnect() or another connect(): calls are taken without a
// connection too, up to the bounds, and process() and the blocking forms make it again, with pauses
// that grow to five seconds. Then the sessions are created, configured and started again in the
// order of their creation, and what was not begun to be written follows. A call that was written
// and not answered fails with Disconnected and is never sent again, since what the service accepted
// survives it. A start that holds goes on, and is answered when its session stops. process() and
// flush() are Ok without a connection; status() says why there is none.
//
// Threads: a client belongs to one thread at a time; different clients are independent.
// fork(): the connection stays with the parent. A child may destroy its copy of the client, which
// sends nothing and leaves the parent's connection alone, and do nothing else with it. Descriptors
// are closed by exec.
// EAGAIN: a full socket is not an error. Calls are buffered up to maxBufferedBytes and written by
// later calls, process() and flush(); beyond that they are refused with BufferFull, as a whole. A
// service whose queue of new connections is full counts as away. EINTR is retried, SIGPIPE never
// raised.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "base/Function.h"
#include "propertylist/Payload.h"

namespace vx {

// What went wrong with a call or the connection.
struct ClientStatus {
  enum class Code : uint8_t {
    Ok,
    NotConnected,  // connect() or reconnect() first
    Disconnected,  // the daemon went away, or sent something that is not the protocol
    BufferFull,    // the daemon is not reading; nothing of the call was kept
    TimedOut,      // a blocking form's patience ended; the answer, if it comes, is ignored
    Refused,  // the daemon answered with an error of the protocol (docs/protocol.md); see wireCode
    ReportingError,  // sendMessage: the service refused the message; see domain and wireCode
    TooLarge         // the call does not fit into a frame, or never into the buffer
  };
  Code code = Code::Ok;
  std::string text;    // a sentence for people
  std::string domain;  // of a ReportingError
  int64_t wireCode = 0;
  bool ok() const { return code == Code::Ok; }
};

// A value, or why there is none.
template <class T>
struct ClientResult {
  ClientStatus status;
  T value{};
  bool ok() const { return status.ok(); }
};

// The validation answer: an unknown reporter gives 0 and 65535.
struct ReporterValidation {
  int64_t reporterID = 0;
  uint16_t serviceType = 65535;
};

class ServiceConnection;

// One connection to the service. Not thread-safe: one thread, or the caller's own lock. Callbacks
// run inside process() and the blocking forms (and, when the connection is lost, inside whatever
// call finds out); they may call back into the client, reconnect it or destroy it. Bounds: Options,
// and what is read: one frame.
class ReportingClient {
 public:
  template <class T>
  using Callback = Function<void(const ClientResult<T>&)>;
  using Done = std::monostate;
  static constexpr std::chrono::milliseconds kDefaultPatience{5000};

  struct Options {
    std::size_t maxBufferedBytes = 1 << 20;  // of calls not yet written
    std::size_t maxPendingCalls = 65536;     // calls not yet answered, held starts included
    // Bytes of calls that are gathered before one write; process() and flush() write whatever there
    // is.
    std::size_t writeAtBytes = 16 << 10;
    // Sessions outlive the connection: see below.
    bool keepSessions = false;
  };
  // Of a client that keeps its sessions; calls, but for the first and the last.
  struct Counters {
    uint64_t reconnections = 0;
    uint64_t unanswered = 0;  // written when the connection was lost: may have run, not sent again
    uint64_t dropped = 0;     // refused with BufferFull, or given up before they were written
    uint64_t sessionsNotRestored = 0;  // the service refused to have them again
  };

  ReportingClient();
  explicit ReportingClient(const Options& options);
  ~ReportingClient();  // an abrupt end, unless goodbye() came first; pending callbacks are not
                       // called
  ReportingClient(const ReportingClient&) = delete;
  ReportingClient& operator=(const ReportingClient&) = delete;

  // "" stands for $VXREPORTING_SOCKET, or /run/vxreporting/service.socket. Waits for the daemon's
  // hello. Pending calls of an earlier connection fail first; when one of their callbacks connects
  // anew, that connection stays.
  ClientStatus connect(std::string socketPath = "",
                       std::chrono::milliseconds patience = kDefaultPatience);
  // Takes an already connected descriptor (tests, sandboxes), in blocking mode.
  ClientStatus adopt(int connectedFd, std::chrono::milliseconds patience = kDefaultPatience);
  ClientStatus reconnect(std::chrono::milliseconds patience = kDefaultPatience);
  bool isConnected() const;
  ClientStatus status() const;  // Ok while connected, otherwise why not
  // An orderly end: everything sent before is run and answered, then the daemon closes. Waits for
  // that.
  ClientStatus goodbye(std::chrono::milliseconds patience = kDefaultPatience);
  // Ends at once; every pending call fails.
  void disconnect();

  // For the caller's own poll loop: wait for reading, and for writing when wantsWrite(), then call
  // process().
  int fd() const;
  bool wantsWrite() const;
  // With keepSessions: call process() again after so long, whatever the descriptor says.
  std::optional<std::chrono::milliseconds> retryIn() const;
  // Writes what is buffered, reads what is there (up to 64 KiB), runs callbacks. Never blocks.
  ClientStatus process();
  // Writes what is buffered as far as the socket takes it. Never blocks.
  ClientStatus flush();
  // process()es until the condition, which callbacks may bring about, holds. Blocks for that long.
  ClientStatus waitUntil(const Function<bool()>& condition,
                         std::chrono::milliseconds patience = kDefaultPatience);

  // --- never blocking: the callback is called once, with the answer or the reason why there will
  // be none. The returned status says whether the call was taken; when it was not, the callback is
  // not called. ---
  ClientStatus createReportingSessionAsync(int64_t reporterID, Callback<bool> done);
  ClientStatus setServiceTypeAsync(uint16_t serviceType, int64_t reporterID, Callback<bool> done);
  ClientStatus getServiceTypeAsync(int64_t reporterID, Callback<uint16_t> done);
  ClientStatus setConfigurationAsync(const Payload& configuration, int64_t reporterID,
                                     Callback<bool> done);
  // Answered when the session is stopped.
  ClientStatus startReportingSession(int64_t reporterID, Callback<bool> done);
  // Without identifiers: to every started session of the service. An empty list routes nothing;
  // one longer than the service takes (docs/protocol.md, max_identifiers) is refused.
  ClientStatus sendMessageAsync(const Payload& message, uint32_t category, uint16_t type,
                                Callback<Done> done = nullptr);
  ClientStatus sendMessageAsync(const Payload& message, uint32_t category, uint16_t type,
                                const std::vector<int64_t>& reporterIDs,
                                Callback<Done> done = nullptr);
  ClientStatus stopReportingSessionAsync(int64_t reporterID, Callback<bool> done);
  ClientStatus destroyReportingSessionAsync(int64_t reporterID, Callback<bool> done);
  ClientStatus validateReporterAsync(int64_t reporterID, Callback<ReporterValidation> done);
  ClientStatus getAllReportersAsync(Callback<std::vector<int64_t>> done);

  // --- blocking, for scripts and tests ---
  // Ends the daemon, and with it the connection: there is no answer but a refusal.
  ClientStatus killService(std::chrono::milliseconds patience = kDefaultPatience);
  ClientResult<bool> createReportingSession(int64_t reporterID,
                                            std::chrono::milliseconds patience = kDefaultPatience);
  ClientResult<bool> setServiceType(uint16_t serviceType, int64_t reporterID,
                                    std::chrono::milliseconds patience = kDefaultPatience);
  ClientResult<uint16_t> getServiceType(int64_t reporterID,
                                        std::chrono::milliseconds patience = kDefaultPatience);
  ClientResult<bool> setConfiguration(const Payload& configuration, int64_t reporterID,
                                      std::chrono::milliseconds patience = kDefaultPatience);
  ClientStatus sendMessage(const Payload& message, uint32_t category, uint16_t type,
                           std::chrono::milliseconds patience = kDefaultPatience);
  ClientStatus sendMessage(const Payload& message, uint32_t category, uint16_t type,
                           const std::vector<int64_t>& reporterIDs,
                           std::chrono::milliseconds patience = kDefaultPatience);
  ClientResult<bool> stopReportingSession(int64_t reporterID,
                                          std::chrono::milliseconds patience = kDefaultPatience);
  ClientResult<bool> destroyReportingSession(int64_t reporterID,
                                             std::chrono::milliseconds patience = kDefaultPatience);
  ClientResult<ReporterValidation> validateReporter(
      int64_t reporterID, std::chrono::milliseconds patience = kDefaultPatience);
  ClientResult<std::vector<int64_t>> getAllReporters(
      std::chrono::milliseconds patience = kDefaultPatience);

  std::size_t pendingCalls() const;
  uint64_t unknownAnswers() const;  // answers to calls that were not made, or answered already
  Counters counters() const;

 private:
  // Callbacks may destroy the client, so its state outlives the call that runs them.
  std::shared_ptr<ServiceConnection> connection_;
};

}  // namespace vx
