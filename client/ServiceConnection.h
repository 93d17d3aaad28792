// The client library's end of the service socket: framing, buffers, the calls that wait. Private to
// the client library.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "base/UniqueFd.h"
#include "client/KeptSessions.h"
#include "client/PendingCalls.h"
#include "client/ReportingClient.h"
#include "wire/FrameReader.h"
#include "wire/FrameWriter.h"

namespace vx {

// Owned by its ReportingClient, and by whatever function of its own is running: a callback may
// destroy the client. Not thread-safe. Bounds: Options, and one frame of the service.
class ServiceConnection : public std::enable_shared_from_this<ServiceConnection> {
 public:
  using Patience = std::chrono::milliseconds;

  explicit ServiceConnection(const ReportingClient::Options& options) : options_(options) {}

  ClientStatus open(const std::string& path, Patience patience);
  ClientStatus adopt(UniqueFd connected, Patience patience);
  const std::string& socketPath() const { return socketPath_; }
  bool isGreeted() const { return helloSeen_; }
  ClientStatus status() const { return isGreeted() ? ClientStatus() : whyNoCalls(); }
  int fd() const { return socket_.get(); }
  ClientStatus sayGoodbye(Patience patience);
  // Every pending call fails with this reason, once.
  void disconnect(const ClientStatus& why);
  // The client is being destroyed: as disconnect(), but no callback runs any more.
  void abandon();

  bool wantsWrite() const { return outBegin_ < out_.size() && mayWrite(); }
  // Until process() should be called though the descriptor, if there is one, is not ready.
  std::optional<Patience> retryIn() const;
  ClientStatus process();
  ClientStatus flush();

  // A call: when acceptsCalls(), beginCall(), write that many arguments, endCall(). endCall() says
  // whether the call was taken; only then is the answer ever delivered.
  bool acceptsCalls() const { return acceptsCalls_; }
  ClientStatus whyNoCalls() const;
  wire::FrameWriter beginCall(wire::Operation operation, std::size_t arguments);
  ClientStatus endCall(wire::FrameWriter& call, CallAnswer answer);

  // Works until the condition holds; a callback may be what makes it hold.
  template <class Condition>
  ClientStatus waitUntil(const Condition& condition, Patience patience) {
    const auto self = shared_from_this();
    Wait wait(patience);
    while (!condition()) {
      if (ClientStatus status = waitStep(wait); !status.ok() && !condition()) return status;
    }
    return {};
  }

  std::size_t pendingCalls() const { return calls_.size(); }
  uint64_t unknownAnswers() const { return unknownAnswers_; }
  ReportingClient::Counters counters() const { return counters_; }

 private:
  enum class Received : uint8_t { Nothing, Something, Ended };
  struct Wait {
    explicit Wait(Patience patience);
    Patience patience;
    std::chrono::steady_clock::time_point deadline;
    bool first = true;
  };

  bool isConnected() const { return static_cast<bool>(socket_); }
  // To a service that leaves, nothing is written that the next one may have.
  bool mayWrite() const { return helloSeen_ && !(keeping_ && goodbyeSeen_); }
  enum class Waits : bool { No, Yes };
  ClientStatus dial(Waits waits, Patience patience, UniqueFd& made) const;
  void attach(UniqueFd connected);
  ClientStatus begin(UniqueFd connected, Patience patience);
  // The connection is lost, sessions are kept.
  void interrupted(const ClientStatus& why);
  void maybeReconnect();
  void retryLater();
  void restoreSessions();
  ClientStatus waitStep(Wait& wait);
  void setReceiveTimeout(Patience patience);

  int writeUpTo(std::size_t end);  // 0, or the errno that ends the connection
  void noteWritten();
  uint64_t firstUnwritten() const;  // number of a call, or the next one's
  std::span<const uint8_t> frameAt(std::size_t at) const;
  void fail(const std::vector<CallAnswer>& calls, const ClientStatus& why);
  void trimOutput();
  ClientStatus lostWhileSending(int error);
  Received lost(const std::string& what);

  Received receive(int flags);
  Received runFrames();
  bool runFrame(std::span<const uint8_t> bytes);
  bool runHello(const Frame& frame);
  void answer(const Value& number, const ClientStatus& status, const Value* value);

  const ReportingClient::Options options_;
  std::string socketPath_;
  UniqueFd socket_;
  bool acceptsCalls_ = false;
  bool helloSeen_ = false;
  bool goodbyeSeen_ = false;
  bool abandoned_ = false;
  uint64_t generation_ = 0;     // changes with every connection and disconnection
  Patience receiveTimeout_{0};  // as the descriptor has it
  std::size_t largestFrame_ = wire::kMaxFrameBytes;  // as the service announced it
  std::string serviceError_;  // what the service said about the connection before closing it
  ClientStatus ended_;        // why the last connection ended

  wire::ReadBuffers readBuffers_;
  wire::FrameReader reader_{readBuffers_};
  std::vector<uint8_t> out_;  // not yet written: from outBegin_
  std::size_t outBegin_ = 0;
  std::size_t writeAt_ = 0;  // bytes in out_ at which the next write is due
  // For keepSessions alone. While keeping_, a connection that is lost is made again.
  bool keeping_ = false;
  bool greetedBefore_ = false;
  KeptSessions kept_;
  std::size_t frameBegin_ = 0;      // in out_: the first frame that is not begun to be written
  std::size_t restorationEnd_ = 0;  // in out_: up to here it is calls of kept_
  Patience delay_{0};               // before the next attempt
  std::chrono::steady_clock::time_point retryAt_;
  ReportingClient::Counters counters_;

  PendingCalls calls_;
  uint64_t unknownAnswers_ = 0;
};

}  // namespace vx
