#include "client/ReportingClient.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <map>
#include <utility>

#include "platform/CborWriter.h"

namespace vx {

namespace {

using SteadyClock = std::chrono::steady_clock;
using Code = ClientStatus::Code;

constexpr const char* kDefaultSocket = "/run/vxreporting/service.socket";
constexpr int64_t kProtocolVersion = 1;
constexpr std::size_t kLengthBytes = 4;
constexpr std::size_t kReadBytes = 64 << 10;
constexpr std::size_t kPendingSlack = 64;
constexpr std::size_t kLargestFrame = 64 << 20;  // of the daemon's; more is not the protocol

enum Operation : uint8_t {
  kCreate = 1,
  kSetServiceType,
  kGetServiceType,
  kSetConfiguration,
  kStart,
  kSend,
  kStop,
  kDestroy,
  kValidate,
  kGetAllReporters,
  kKill,
};
enum FrameKind : uint8_t { kHello = 0, kCall = 1, kReply = 2, kError = 3, kGoodbye = 4 };

ClientStatus failure(Code code, std::string text) { return {code, std::move(text), "", 0}; }

}  // namespace

// The connection and its pending calls. Answers are handed to each call as the reply's value, or as
// a status.
struct ReportingClient::Connection : std::enable_shared_from_this<Connection> {
  using Answer = Function<void(const ClientStatus&, const Value*)>;
  struct Pending {
    Answer answer;
    bool waiting = false;
  };

  explicit Connection(const Options& configured) : options(configured) {}
  ~Connection() {
    if (fd >= 0) close(fd);
  }

  // --- connecting ---

  ClientStatus open(const std::string& path, std::chrono::milliseconds patience) {
    socketPath = path;
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) {
      return failure(Code::NotConnected,
                     "the socket path " + path + " is too long for a Unix socket");
    }
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    const int made = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (made < 0 ||
        ::connect(made, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
      const std::string why = std::strerror(errno);
      if (made >= 0) close(made);
      return failure(Code::NotConnected,
                     "cannot connect to " + path + ": " + why +
                         " (is vxreportingd running? set VXREPORTING_SOCKET to its socket)");
    }
    return begin(made, patience);
  }

  ClientStatus begin(int connectedFd, std::chrono::milliseconds patience) {
    disconnect(failure(Code::Disconnected, "the connection was made anew"));
    fd = connectedFd;
    in.clear();
    out.clear();
    outOffset = 0;
    helloSeen = goodbyeSeen = false;
    lastError.clear();
    const std::size_t start = beginFrame();
    CborWriter writer(out);
    writer.array(2);
    writer.integer(kHello);
    writer.integer(kProtocolVersion);
    endFrame(start);
    const ClientStatus status = waitUntil([this] { return helloSeen; }, patience);
    if (!status.ok() && isConnected()) disconnect(status);
    return status;
  }

  bool isConnected() const { return fd >= 0; }

  // Every pending call fails with the same reason, once each.
  void disconnect(const ClientStatus& why) {
    if (fd < 0) return;
    close(fd);
    fd = -1;
    std::deque<Pending> failed;
    std::map<uint64_t, Answer> failedHeld;
    failed.swap(pending);
    failedHeld.swap(held);
    firstPending = nextNumber;
    pendingCount = 0;
    const auto self = shared_from_this();  // a callback may destroy the client
    for (auto& [number, answer] : failedHeld) {
      if (answer) answer(why, nullptr);
    }
    for (Pending& call : failed) {
      if (call.waiting && call.answer) call.answer(why, nullptr);
    }
  }

  ClientStatus lost(const std::string& what) {
    ClientStatus status = failure(Code::Disconnected, lastError.empty() ? what : lastError);
    disconnect(status);
    return status;
  }

  // --- calls ---

  std::size_t beginFrame() {
    const std::size_t start = out.size();
    out.resize(start + kLengthBytes);
    return start;
  }
  void endFrame(std::size_t start) {
    const std::size_t length = out.size() - start - kLengthBytes;
    for (std::size_t i = 0; i < kLengthBytes; ++i)
      out[start + i] = static_cast<uint8_t>(length >> (8 * i));
  }

  // `arguments` writes that many items behind the operation.
  template <class WriteArguments>
  ClientStatus call(Operation operation, std::size_t count, const WriteArguments& arguments,
                    Answer answer) {
    if (fd < 0) return failure(Code::NotConnected, "not connected to the service");
    const std::size_t start = beginFrame();
    CborWriter writer(out);
    writer.array(3 + count);
    writer.integer(kCall);
    writer.unsignedInteger(nextNumber);
    writer.integer(operation);
    arguments(writer);
    endFrame(start);
    if (out.size() - outOffset > options.maxBufferedBytes) {
      const bool wasEmpty = start == outOffset;
      out.resize(start);
      if (wasEmpty) return failure(Code::BufferFull, "the call is larger than the buffer allows");
      const ClientStatus flushed = flush();
      if (!flushed.ok()) return flushed;
      return failure(Code::BufferFull, "the service is not reading; " +
                                           std::to_string(out.size() - outOffset) +
                                           " bytes wait already");
    }
    pending.push_back({std::move(answer), true});
    ++pendingCount;
    ++nextNumber;
    if (out.size() - outOffset >= options.writeAtBytes) return flush();
    return {};
  }

  ClientStatus flush() {
    while (fd >= 0 && outOffset < out.size()) {
      const ssize_t sent =
          send(fd, out.data() + outOffset, out.size() - outOffset, MSG_DONTWAIT | MSG_NOSIGNAL);
      if (sent < 0 && errno == EINTR) continue;
      if (sent < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) break;
      if (sent < 0) {
        // What the service said before it left is still to be read.
        const int why = errno;
        (void)receive(MSG_DONTWAIT);
        return isConnected() ? lost(std::string("the service went away: ") + std::strerror(why))
                             : failure(Code::Disconnected, "the service went away");
      }
      outOffset += static_cast<std::size_t>(sent);
    }
    if (outOffset == out.size()) {
      out.clear();
      outOffset = 0;
    } else if (outOffset > options.maxBufferedBytes / 2) {
      out.erase(out.begin(), out.begin() + static_cast<std::ptrdiff_t>(outOffset));
      outOffset = 0;
    }
    return {};
  }

  // --- answers ---

  // One read and everything complete in it. Status: lost connections.
  ClientStatus receive(int flags) {
    const std::size_t had = in.size();
    in.resize(had + kReadBytes);
    ssize_t got = 0;
    do {
      got = recv(fd, in.data() + had, kReadBytes, flags);
    } while (got < 0 && errno == EINTR);
    const int why = errno;
    in.resize(had + static_cast<std::size_t>(got > 0 ? got : 0));
    if (got < 0) {
      return why == EAGAIN || why == EWOULDBLOCK
                 ? ClientStatus{}
                 : lost(std::string("the service went away: ") + std::strerror(why));
    }
    if (got == 0) {
      return lost(goodbyeSeen ? "the service said goodbye" : "the service closed the connection");
    }
    return runFrames();
  }

  ClientStatus runFrames() {
    const auto self = shared_from_this();
    std::vector<uint8_t> bytes;
    bytes.swap(in);
    std::size_t at = 0;
    const uint64_t generation = connectionGeneration;
    while (bytes.size() - at >= kLengthBytes) {
      const uint8_t* head = bytes.data() + at;
      const std::size_t length = head[0] | std::size_t{head[1]} << 8 | std::size_t{head[2]} << 16 |
                                 std::size_t{head[3]} << 24;
      if (length > kLargestFrame)
        return lost("the service sent a frame of " + std::to_string(length) + " bytes");
      if (bytes.size() - at - kLengthBytes < length) break;
      if (!runFrame({head + kLengthBytes, length}))
        return lost("the service sent something that is not the protocol");
      at += kLengthBytes + length;
      // A callback may have disconnected, or connected anew: these bytes are of the old connection.
      if (fd < 0) return failure(Code::Disconnected, "disconnected");
      if (generation != connectionGeneration) return {};
    }
    // What a callback's own process() read comes behind what was left here.
    in.insert(in.begin(), bytes.begin() + static_cast<std::ptrdiff_t>(at), bytes.end());
    return {};
  }

  bool runFrame(std::span<const uint8_t> frame) {
    const std::optional<ArrayView> items = FrameDecoder::decode(frame);
    if (!items || items->empty()) return false;
    auto at = items->begin();
    const int64_t kind = (*at).asInt64();
    if (kind == kHello) return items->size() >= 2 ? (helloSeen = true) : false;
    if (kind == kGoodbye) return goodbyeSeen = true;
    if ((kind != kReply && kind != kError) || items->size() < 3) return false;
    ++at;
    const Value number = *at;
    ++at;
    if (kind == kReply) {
      const Value value = *at;
      answer(number, {}, &value);
      return true;
    }
    if (items->size() < 4) return false;
    ClientStatus status = failure(Code::Refused, "");
    status.wireCode = (*at).asInt64();
    ++at;
    status.text = (*at).asString();
    if (number.kind() == ValueKind::Null)
      lastError = status.text;  // about the connection, which ends
    else
      answer(number, status, nullptr);
    return true;
  }

  void answer(const Value& numberValue, const ClientStatus& status, const Value* value) {
    const uint64_t number = numberValue.asUInt64();
    Answer answered;
    if (const auto older = held.find(number); older != held.end()) {
      answered = std::move(older->second);
      held.erase(older);
    } else if (numberValue.kind() == ValueKind::Integer && number >= firstPending &&
               number - firstPending < pending.size() && pending[number - firstPending].waiting) {
      Pending& call = pending[number - firstPending];
      call.waiting = false;
      answered = std::move(call.answer);
    } else {
      ++unknownAnswers;
      return;
    }
    --pendingCount;
    while (!pending.empty() &&
           (!pending.front().waiting || pending.size() > 2 * pendingCount + kPendingSlack)) {
      // A call that is answered much later than its successors, a start for one, must not keep
      // their places taken.
      if (pending.front().waiting) held.emplace(firstPending, std::move(pending.front().answer));
      pending.pop_front();
      ++firstPending;
    }
    if (answered) answered(status, value);
  }

  // Works until the condition holds. The condition may be met by a callback.
  template <class Condition>
  ClientStatus waitUntil(const Condition& condition, std::chrono::milliseconds patience) {
    const auto deadline = SteadyClock::now() + patience;
    const auto self = shared_from_this();
    for (;;) {
      if (condition()) return {};
      if (fd < 0)
        return failure(Code::Disconnected, lastError.empty() ? "the service went away" : lastError);
      if (ClientStatus status = flush(); !status.ok()) return status;
      pollfd ready{fd, static_cast<short>(POLLIN | (wantsWrite() ? POLLOUT : 0)), 0};
      const auto left =
          std::chrono::ceil<std::chrono::milliseconds>(deadline - SteadyClock::now()).count();
      if (left <= 0) return failure(Code::TimedOut, "no answer from the service in time");
      if (poll(&ready, 1, static_cast<int>(left)) < 0 && errno != EINTR) {
        return failure(Code::Disconnected, std::strerror(errno));
      }
      if (ready.revents & (POLLIN | POLLHUP | POLLERR)) {
        if (ClientStatus status = receive(MSG_DONTWAIT); !status.ok() && !condition())
          return status;
      }
    }
  }

  bool wantsWrite() const { return outOffset < out.size(); }

  const Options options;
  std::string socketPath;
  int fd = -1;
  uint64_t connectionGeneration = 0;
  std::vector<uint8_t> in;
  std::vector<uint8_t> out;
  std::size_t outOffset = 0;
  bool helloSeen = false;
  bool goodbyeSeen = false;
  std::string lastError;
  // Calls are numbered in turn: the one called n is at n - firstPending, or among the held ones.
  std::deque<Pending> pending;
  std::map<uint64_t, Answer> held;
  uint64_t firstPending = 1;
  uint64_t nextNumber = 1;
  std::size_t pendingCount = 0;
  uint64_t unknownAnswers = 0;
};

namespace {

using Connection = ReportingClient::Connection;

// How a reply's value is read; false when it is not of the kind it must be.
bool readAnswer(const Value& value, bool& out) {
  out = value.asBool();
  return value.kind() == ValueKind::Boolean;
}
bool readAnswer(const Value& value, uint16_t& out) {
  out = static_cast<uint16_t>(value.asUInt64());
  return value.kind() == ValueKind::Integer && value.asInt64() >= 0 &&
         value.asInt64() <= UINT16_MAX;
}
bool readAnswer(const Value& value, ReporterValidation& out) {
  if (!value.isDictionary()) return false;
  const DictionaryView answer = value.asDictionary();
  const std::optional<Value> reporter = answer.find("reporterID");
  const std::optional<Value> type = answer.find("serviceType");
  if (!reporter || !type) return false;
  out.reporterID = reporter->asInt64();
  return readAnswer(*type, out.serviceType);
}
bool readAnswer(const Value& value, std::vector<int64_t>& out) {
  if (!value.isArray()) return false;
  for (const Value element : value.asArray()) out.push_back(element.asInt64());
  return true;
}

template <class T>
Connection::Answer answerFor(ReportingClient::Callback<T> done) {
  if (!done) return nullptr;
  return [done = std::move(done)](const ClientStatus& status, const Value* value) {
    ClientResult<T> result{status, {}};
    if (value != nullptr && !readAnswer(*value, result.value)) {
      result.status = failure(Code::Refused, "the service answered with a value of another kind");
    }
    done(result);
  };
}

// sendMessage answers null, or the error that refused the message.
Connection::Answer answerForMessage(ReportingClient::Callback<ReportingClient::Done> done) {
  if (!done) return nullptr;
  return [done = std::move(done)](const ClientStatus& status, const Value* value) {
    ClientResult<ReportingClient::Done> result{status, {}};
    if (value != nullptr && value->isDictionary()) {
      const DictionaryView error = value->asDictionary();
      const std::optional<Value> domain = error.find("domain");
      const std::optional<Value> code = error.find("code");
      const std::optional<Value> reason = error.find("reason");
      result.status.code = Code::ReportingError;
      result.status.domain = domain ? domain->asString() : "";
      result.status.wireCode = code ? code->asInt64() : 0;
      result.status.text = reason ? std::string(reason->asString())
                                  : "the service refused the message (" + result.status.domain +
                                        ", code " + std::to_string(result.status.wireCode) + ")";
    }
    done(result);
  };
}

// Makes the call and waits for its answer. The result lives on its own: patience may end before the
// answer comes.
template <class T, class Call>
ClientResult<T> blocking(const std::shared_ptr<Connection>& connection,
                         std::chrono::milliseconds patience, const Call& call) {
  struct Waiting {
    bool answered = false;
    ClientResult<T> result;
  };
  const auto waiting = std::make_shared<Waiting>();
  const ClientStatus taken = call([waiting](const ClientResult<T>& result) {
    waiting->result = result;
    waiting->answered = true;
  });
  if (!taken.ok()) return {taken, {}};
  const ClientStatus status = connection->waitUntil([&] { return waiting->answered; }, patience);
  if (!waiting->answered) return {status, {}};
  return waiting->result;
}

void writeReporter(CborWriter& writer, int64_t reporterID) { writer.integer(reporterID); }

}  // namespace

ReportingClient::ReportingClient() : ReportingClient(Options()) {}
ReportingClient::ReportingClient(const Options& options)
    : connection_(std::make_shared<Connection>(options)) {}
ReportingClient::~ReportingClient() {
  if (connection_->fd >= 0) close(connection_->fd);
  connection_->fd = -1;
}

ClientStatus ReportingClient::connect(std::string socketPath, std::chrono::milliseconds patience) {
  if (socketPath.empty()) {
    const char* named = std::getenv("VXREPORTING_SOCKET");
    socketPath = named != nullptr && *named != '\0' ? named : kDefaultSocket;
  }
  const auto connection = connection_;
  ++connection->connectionGeneration;
  return connection->open(socketPath, patience);
}

ClientStatus ReportingClient::adopt(int connectedFd, std::chrono::milliseconds patience) {
  const auto connection = connection_;
  ++connection->connectionGeneration;
  return connection->begin(connectedFd, patience);
}

ClientStatus ReportingClient::reconnect(std::chrono::milliseconds patience) {
  return connect(connection_->socketPath, patience);
}

bool ReportingClient::isConnected() const { return connection_->isConnected(); }
int ReportingClient::fd() const { return connection_->fd; }
bool ReportingClient::wantsWrite() const { return connection_->wantsWrite(); }
std::size_t ReportingClient::pendingCalls() const { return connection_->pendingCount; }
uint64_t ReportingClient::unknownAnswers() const { return connection_->unknownAnswers; }

void ReportingClient::disconnect() {
  const auto connection = connection_;
  connection->disconnect(failure(Code::Disconnected, "disconnected by the caller"));
}

ClientStatus ReportingClient::goodbye(std::chrono::milliseconds patience) {
  const auto connection = connection_;
  if (!connection->isConnected())
    return failure(Code::NotConnected, "not connected to the service");
  const std::size_t start = connection->beginFrame();
  CborWriter writer(connection->out);
  writer.array(1);
  writer.integer(kGoodbye);
  connection->endFrame(start);
  const ClientStatus status =
      connection->waitUntil([&] { return !connection->isConnected(); }, patience);
  if (connection->isConnected())
    connection->disconnect(failure(Code::Disconnected, "said goodbye"));
  return status;
}

ClientStatus ReportingClient::process() {
  const auto connection = connection_;
  if (!connection->isConnected())
    return failure(Code::NotConnected, "not connected to the service");
  if (ClientStatus status = connection->flush(); !status.ok()) return status;
  return connection->receive(MSG_DONTWAIT);
}

ClientStatus ReportingClient::flush() {
  const auto connection = connection_;
  return connection->flush();
}

// ---------------------------------------------------------------------------------------------------------------------
// Never blocking

ClientStatus ReportingClient::createReportingSessionAsync(int64_t reporterID, Callback<bool> done) {
  return connection_->call(
      kCreate, 1, [&](CborWriter& w) { writeReporter(w, reporterID); },
      answerFor<bool>(std::move(done)));
}

ClientStatus ReportingClient::setServiceTypeAsync(uint16_t serviceType, int64_t reporterID,
                                                  Callback<bool> done) {
  return connection_->call(
      kSetServiceType, 2,
      [&](CborWriter& w) {
        w.integer(serviceType);
        writeReporter(w, reporterID);
      },
      answerFor<bool>(std::move(done)));
}

ClientStatus ReportingClient::getServiceTypeAsync(int64_t reporterID, Callback<uint16_t> done) {
  return connection_->call(
      kGetServiceType, 1, [&](CborWriter& w) { writeReporter(w, reporterID); },
      answerFor<uint16_t>(std::move(done)));
}

ClientStatus ReportingClient::setConfigurationAsync(const Payload& configuration,
                                                    int64_t reporterID, Callback<bool> done) {
  return connection_->call(
      kSetConfiguration, 2,
      [&](CborWriter& w) {
        w.encoded(configuration.encoded());
        writeReporter(w, reporterID);
      },
      answerFor<bool>(std::move(done)));
}

ClientStatus ReportingClient::startReportingSession(int64_t reporterID, Callback<bool> done) {
  return connection_->call(
      kStart, 1, [&](CborWriter& w) { writeReporter(w, reporterID); },
      answerFor<bool>(std::move(done)));
}

ClientStatus ReportingClient::sendMessageAsync(const Payload& message, uint32_t category,
                                               uint16_t type, Callback<Done> done) {
  return connection_->call(
      kSend, 4,
      [&](CborWriter& w) {
        w.encoded(message.encoded());
        w.unsignedInteger(category);
        w.unsignedInteger(type);
        w.null();
      },
      answerForMessage(std::move(done)));
}

ClientStatus ReportingClient::sendMessageAsync(const Payload& message, uint32_t category,
                                               uint16_t type,
                                               const std::vector<int64_t>& reporterIDs,
                                               Callback<Done> done) {
  return connection_->call(
      kSend, 4,
      [&](CborWriter& w) {
        w.encoded(message.encoded());
        w.unsignedInteger(category);
        w.unsignedInteger(type);
        w.array(reporterIDs.size());
        for (const int64_t id : reporterIDs) w.integer(id);
      },
      answerForMessage(std::move(done)));
}

ClientStatus ReportingClient::stopReportingSessionAsync(int64_t reporterID, Callback<bool> done) {
  return connection_->call(
      kStop, 1, [&](CborWriter& w) { writeReporter(w, reporterID); },
      answerFor<bool>(std::move(done)));
}

ClientStatus ReportingClient::destroyReportingSessionAsync(int64_t reporterID,
                                                           Callback<bool> done) {
  return connection_->call(
      kDestroy, 1, [&](CborWriter& w) { writeReporter(w, reporterID); },
      answerFor<bool>(std::move(done)));
}

ClientStatus ReportingClient::validateReporterAsync(int64_t reporterID,
                                                    Callback<ReporterValidation> done) {
  return connection_->call(
      kValidate, 1, [&](CborWriter& w) { writeReporter(w, reporterID); },
      answerFor<ReporterValidation>(std::move(done)));
}

ClientStatus ReportingClient::getAllReportersAsync(Callback<std::vector<int64_t>> done) {
  return connection_->call(
      kGetAllReporters, 0, [](CborWriter&) {}, answerFor<std::vector<int64_t>>(std::move(done)));
}

ClientStatus ReportingClient::killService() {
  const ClientStatus status = connection_->call(
      kKill, 0, [](CborWriter&) {}, nullptr);
  return status.ok() ? flush() : status;
}

// ---------------------------------------------------------------------------------------------------------------------
// Blocking

ClientResult<bool> ReportingClient::createReportingSession(int64_t reporterID,
                                                           std::chrono::milliseconds patience) {
  return blocking<bool>(connection_, patience, [&](Callback<bool> done) {
    return createReportingSessionAsync(reporterID, std::move(done));
  });
}

ClientResult<bool> ReportingClient::setServiceType(uint16_t serviceType, int64_t reporterID,
                                                   std::chrono::milliseconds patience) {
  return blocking<bool>(connection_, patience, [&](Callback<bool> done) {
    return setServiceTypeAsync(serviceType, reporterID, std::move(done));
  });
}

ClientResult<uint16_t> ReportingClient::getServiceType(int64_t reporterID,
                                                       std::chrono::milliseconds patience) {
  return blocking<uint16_t>(connection_, patience, [&](Callback<uint16_t> done) {
    return getServiceTypeAsync(reporterID, std::move(done));
  });
}

ClientResult<bool> ReportingClient::setConfiguration(const Payload& configuration,
                                                     int64_t reporterID,
                                                     std::chrono::milliseconds patience) {
  return blocking<bool>(connection_, patience, [&](Callback<bool> done) {
    return setConfigurationAsync(configuration, reporterID, std::move(done));
  });
}

ClientStatus ReportingClient::sendMessage(const Payload& message, uint32_t category, uint16_t type,
                                          std::chrono::milliseconds patience) {
  return blocking<Done>(connection_, patience,
                        [&](Callback<Done> done) {
                          return sendMessageAsync(message, category, type, std::move(done));
                        })
      .status;
}

ClientStatus ReportingClient::sendMessage(const Payload& message, uint32_t category, uint16_t type,
                                          const std::vector<int64_t>& reporterIDs,
                                          std::chrono::milliseconds patience) {
  return blocking<Done>(connection_, patience,
                        [&](Callback<Done> done) {
                          return sendMessageAsync(message, category, type, reporterIDs,
                                                  std::move(done));
                        })
      .status;
}

ClientResult<bool> ReportingClient::stopReportingSession(int64_t reporterID,
                                                         std::chrono::milliseconds patience) {
  return blocking<bool>(connection_, patience, [&](Callback<bool> done) {
    return stopReportingSessionAsync(reporterID, std::move(done));
  });
}

ClientResult<bool> ReportingClient::destroyReportingSession(int64_t reporterID,
                                                            std::chrono::milliseconds patience) {
  return blocking<bool>(connection_, patience, [&](Callback<bool> done) {
    return destroyReportingSessionAsync(reporterID, std::move(done));
  });
}

ClientResult<ReporterValidation> ReportingClient::validateReporter(
    int64_t reporterID, std::chrono::milliseconds patience) {
  return blocking<ReporterValidation>(connection_, patience,
                                      [&](Callback<ReporterValidation> done) {
                                        return validateReporterAsync(reporterID, std::move(done));
                                      });
}

ClientResult<std::vector<int64_t>> ReportingClient::getAllReporters(
    std::chrono::milliseconds patience) {
  return blocking<std::vector<int64_t>>(
      connection_, patience,
      [&](Callback<std::vector<int64_t>> done) { return getAllReportersAsync(std::move(done)); });
}

}  // namespace vx
