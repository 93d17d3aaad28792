#include "client/PendingCalls.h"

#include <algorithm>
#include <optional>
#include <string>
#include <utility>

namespace vx {

namespace {

using Code = ClientStatus::Code;

constexpr std::size_t kSmallestRing = 64;

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
  const std::optional<Value> reporter = value.asDictionary().find("reporterID");
  const std::optional<Value> type = value.asDictionary().find("serviceType");
  if (!reporter || !type || reporter->kind() != ValueKind::Integer) return false;
  out.reporterID = reporter->asInt64();
  return readAnswer(*type, out.serviceType);
}

bool readAnswer(const Value& value, std::vector<int64_t>& out) {
  if (!value.isArray()) return false;
  for (const Value element : value.asArray()) {
    if (element.kind() != ValueKind::Integer) return false;
    out.push_back(element.asInt64());
  }
  return true;
}

// sendMessage answers null, or the error with which the message was refused.
void readError(const Value& value, ClientStatus& status) {
  const DictionaryView error = value.asDictionary();
  const std::optional<Value> domain = error.find("domain");
  const std::optional<Value> code = error.find("code");
  const std::optional<Value> reason = error.find("reason");
  status.code = Code::ReportingError;
  if (domain) status.domain = domain->asString();
  if (code) status.wireCode = code->asInt64();
  status.text = "the service refused the message (" + status.domain + ", code " +
                std::to_string(status.wireCode) + ")";
  if (reason) status.text += ": " + std::string(reason->asString());
}

template <class T>
void run(const ReportingClient::Callback<T>& done, const ClientStatus& status, const Value* value) {
  if (!done) return;
  ClientResult<T> result{status, {}};
  bool understood = true;
  if (value != nullptr) {
    if constexpr (std::is_same_v<T, ReportingClient::Done>) {
      understood = value->isDictionary() || value->kind() == ValueKind::Null;
      if (value->isDictionary()) readError(*value, result.status);
    } else {
      understood = readAnswer(*value, result.value);
    }
  }
  if (!understood) {
    result = {{Code::Refused, "the service answered with a value of another kind", "", 0}, {}};
  }
  done(result);
}

void run(std::monostate, const ClientStatus&, const Value*) {}

}  // namespace

void deliver(const CallAnswer& answer, const ClientStatus& status, const Value* value) {
  std::visit([&](const auto& done) { run(done, status, value); }, answer);
}

bool PendingCalls::take(uint64_t number, CallAnswer& answer) {
  if (number >= first_ && number < next_) {
    Slot& slot = at(number);
    if (!slot.waiting) return false;
    answer = std::move(slot.answer);
    slot.answer = std::monostate();
    slot.waiting = false;
    while (first_ != next_ && !at(first_).waiting) ++first_;
  } else {
    const auto older = older_.find(number);
    if (older == older_.end()) return false;
    answer = std::move(older->second);
    older_.erase(older);
  }
  --waiting_;
  return true;
}

std::vector<CallAnswer> PendingCalls::takeBefore(uint64_t end, const std::set<uint64_t>& except) {
  std::vector<CallAnswer> taken;
  const auto takes = [&](uint64_t number) { return number < end && !except.contains(number); };
  for (auto it = older_.begin(); it != older_.end();) {
    if (takes(it->first)) taken.push_back(std::move(it->second));
    it = takes(it->first) ? older_.erase(it) : std::next(it);
  }
  for (uint64_t number = first_; number != next_; ++number) {
    Slot& slot = at(number);
    if (!slot.waiting || !takes(number)) continue;
    taken.push_back(std::move(slot.answer));
    slot.answer = std::monostate();
    slot.waiting = false;
  }
  while (first_ != next_ && !at(first_).waiting) ++first_;
  waiting_ -= taken.size();
  return taken;
}

// The ring is full. When few of its calls still wait, those at its front keep the others from
// leaving; otherwise it is too small.
void PendingCalls::makeRoom() {
  if (2 * (waiting_ - older_.size()) < ring_.size()) {
    for (std::size_t freed = 0; freed < ring_.size() / 2; ++freed, ++first_) {
      Slot& slot = at(first_);
      if (slot.waiting) older_.emplace(first_, std::move(slot.answer));
      slot.answer = std::monostate();
      slot.waiting = false;
    }
    return;
  }
  std::vector<Slot> larger(std::max(kSmallestRing, 2 * ring_.size()));
  for (uint64_t number = first_; number != next_; ++number)
    larger[number & (larger.size() - 1)] = std::move(at(number));
  ring_ = std::move(larger);
}

}  // namespace vx
