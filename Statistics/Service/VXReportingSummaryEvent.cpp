#include "Statistics/Service/VXReportingSummaryEvent.h"

#include <span>
#include <vector>

#include "propertylist/CborReader.h"

namespace vx {

VXReportingSummaryEvent::VXReportingSummaryEvent(ServiceType serviceType) {
  append(groupFor("VX_Session_Summary_Event"), std::to_string(serviceType));
}

void VXReportingSummaryEvent::add(const VXReportingRow& row) {
  if (row.shape == VXReportingRows::kNoShape) {
    for (const auto& [key, value] : row.dictionary) add(groupFor(key), value);
    return;
  }
  if (row.shape >= shapes_.size()) shapes_.resize(row.shape + std::size_t{1});
  std::vector<Group*>& groups = shapes_[row.shape];
  if (groups.size() < row.keys.size())
    for (const std::string_view key : row.keys) groups.push_back(&groupFor(key));
  for (std::size_t i = 0; i < groups.size(); ++i) add(*groups[i], row.values[i]);
}

void VXReportingSummaryEvent::add(Group& group, const Value& value) {
  const cbor::Head head = cbor::head(value.encoded().data());
  switch (head.major()) {
    case cbor::kText:
      return append(group, {reinterpret_cast<const char*>(head.next), head.argument});
    case cbor::kArray:
    case cbor::kMap:
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

VXReportingSummaryEvent::Group& VXReportingSummaryEvent::groupFor(std::string_view key) {
  const auto found = index_.find(key);
  if (found != index_.end()) return *found->second;
  Group& group = groups_.emplace_back();
  group.key = key;
  index_.emplace(group.key, &group);
  return group;
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
