#include "client/KeptSessions.h"

#include <algorithm>

#include "wire/FrameWriter.h"

namespace vx {

using wire::FrameWriter;
using wire::Operation;

namespace {

// | array head 1 byte | kind 1 byte | number 1, 2, 3, 5 or 9 bytes | operation 1 byte | arguments
struct Head {
  explicit Head(std::span<const uint8_t> body) {
    const uint8_t* at = body.data() + 2;
    const unsigned low = *at++ & 0x1F;
    number = low < 24 ? low : 0;
    if (low >= 24) {
      for (unsigned left = 1U << (low - 24); left > 0; --left) number = number << 8 | *at++;
    }
    operation = static_cast<Operation>(*at);
  }
  uint64_t number;
  Operation operation;
};

}  // namespace

uint64_t KeptSessions::numberOf(std::span<const uint8_t> body) { return Head(body).number; }

KeptSessions::Session* KeptSessions::find(int64_t identifier) {
  const auto found = std::ranges::find(sessions_, identifier, &Session::identifier);
  return found == sessions_.end() ? nullptr : &*found;
}

void KeptSessions::written(std::span<const uint8_t> body) {
  const Head head(body);
  if (head.operation == Operation::SendMessage || head.operation >= Operation::ReporterID ||
      head.operation == Operation::GetServiceNameForReporterID)
    return;
  // What the service does not accept would end the next connection too.
  const std::optional<Frame> frame = Frame::decode(body);
  if (!frame) return;
  const int64_t identifier = (*frame)[frame->size() - 1].asInt64();
  if (head.operation == Operation::CreateReportingSession ||
      head.operation == Operation::DestroyReportingSession)
    std::erase_if(sessions_, [&](const Session& s) { return s.identifier == identifier; });
  if (head.operation == Operation::CreateReportingSession)
    sessions_.push_back({identifier, head.number, {}, {}, 0});
  Session* const session = find(identifier);
  if (session == nullptr) return;
  if (head.operation == Operation::SetServiceType)
    session->serviceType = static_cast<uint16_t>((*frame)[wire::kCallHead].asInt64());
  else if (head.operation == Operation::SetConfiguration)
    session->configuration = frame->payload(wire::kCallHead);
  else if (head.operation == Operation::StartReportingSessionForID && session->startedBy == 0)
    session->startedBy = head.number;
  else if (head.operation == Operation::StopReportingSessionForID)
    session->startedBy = 0;
}

void KeptSessions::answered(uint64_t number, bool refused) {
  if (refused) std::erase_if(sessions_, [&](const Session& s) { return s.createdBy == number; });
  for (Session& session : sessions_) {
    if (session.startedBy == number) session.startedBy = 0;
  }
}

std::set<uint64_t> KeptSessions::heldStarts() const {
  std::set<uint64_t> held;
  for (const Session& session : sessions_) {
    if (session.startedBy != 0) held.insert(session.startedBy);
  }
  return held;
}

std::size_t KeptSessions::restore(std::vector<uint8_t>& out, std::size_t largestFrame) const {
  std::size_t leftOut = 0;
  uint64_t first = kFirstNumber;
  for (const Session& session : sessions_) {
    const auto call = [&](uint64_t number, Operation operation, const auto&... arguments) {
      FrameWriter frame = FrameWriter::call(out, number, operation, sizeof...(arguments) + 1);
      (arguments(frame.items()), ...);
      frame.items().integer(session.identifier);
      frame.end();
      if (frame.bodyBytes() <= largestFrame) return;
      frame.discard();
      ++leftOut;
    };
    call(first, Operation::CreateReportingSession);
    if (session.serviceType)
      call(first + 1, Operation::SetServiceType,
           [&](CborWriter& w) { w.integer(*session.serviceType); });
    if (session.configuration)
      call(first + 2, Operation::SetConfiguration,
           [&](CborWriter& w) { w.encoded(session.configuration->encoded()); });
    if (session.startedBy != 0) call(session.startedBy, Operation::StartReportingSessionForID);
    first += kSteps;
  }
  return leftOut;
}

}  // namespace vx
