#include "Statistics/Service/VXReportingSummaryEvent.h"

#include <span>
#include <vector>

namespace vx {

VXReportingSummaryEvent::VXReportingSummaryEvent(ServiceType serviceType) {
  append(groups_[indexOf("VX_Session_Summary_Event")], std::to_string(serviceType));
}

void VXReportingSummaryEvent::add(const Payload& payload) {
  next_ = first_;
  bool atFirst = true;
  for (const auto& [key, value] : payload) {
    if (next_ >= groups_.size() || groups_[next_].key != key) next_ = indexOf(key);
    if (atFirst) first_ = next_;
    atFirst = false;
    add(groups_[next_++], value);
  }
}

void VXReportingSummaryEvent::add(Group& group, const Value& value) {
  switch (value.kind()) {
    case ValueKind::String:
      return append(group, value.asString());
    case ValueKind::Array:
    case ValueKind::Dictionary:
      return append(group, value.text());
    default:
      break;
  }
  char text[Value::kMaxScalarText];
  append(group, {text, value.writeScalarText(text)});
}

void VXReportingSummaryEvent::append(Group& group, std::string_view text) {
  if (group.any) group.text.push_back(',');
  group.any = true;
  group.text.append(text);
}

std::size_t VXReportingSummaryEvent::indexOf(std::string_view key) {
  const auto found = index_.find(key);
  if (found != index_.end()) return found->second;
  Group& group = groups_.emplace_back();
  group.key = key;
  index_.emplace(group.key, groups_.size() - 1);
  return groups_.size() - 1;
}

Payload VXReportingSummaryEvent::build() const {
  std::vector<PayloadBuilder::JoinedText> texts;
  texts.reserve(groups_.size());
  for (const Group& group : groups_) {
    std::vector<std::string_view> pieces;
    group.text.forEachChunk(
        [&](std::span<const char> chunk) { pieces.emplace_back(chunk.data(), chunk.size()); });
    texts.push_back({group.key, std::move(pieces)});
  }
  return PayloadBuilder::joined(texts);
}

}  // namespace vx
