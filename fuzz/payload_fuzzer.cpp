// Whatever bytes come: they are refused, or every view of them can be walked and a builder makes
// the same property list of them again.
#include <algorithm>

#include "propertylist/JsonWriter.h"
#include "propertylist/Payload.h"

namespace {

void require(bool holds) {
  if (!holds) __builtin_trap();
}

void walk(const vx::Value& value) {
  std::string json;
  vx::appendJson(json, value);
  require(!json.empty() && !value.encoded().empty());
  require(value.isString() ? value.text() == value.asString() : !value.text().empty());
  require(value.asBool() || value.asInt64() == 0 || value.kind() == vx::ValueKind::Date);
  for (const vx::Value& element : value.asArray()) walk(element);
  for (const auto& [key, inner] : value.asDictionary()) walk(inner);
  const vx::Payload copy = vx::Payload::copyOf(value);
  const vx::Payload again = vx::PayloadBuilder(copy).merge(copy).build();
  require(again.size() == copy.size() && again.text() == copy.text());
  require(again.hasSpaceInKeys() == copy.hasSpaceInKeys());
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (const auto frame = vx::Frame::decode({data, size})) {
    for (std::size_t i = 0; i < std::min(frame->size(), vx::Frame::kMaxElements); ++i) {
      walk((*frame)[i]);
      if (!(*frame)[i].isDictionary()) continue;
      const vx::Payload copy = vx::Payload::copyOf((*frame)[i]);
      require(frame->payload(i) == copy &&
              frame->payload(i).hasSpaceInKeys() == copy.hasSpaceInKeys());
    }
  }
  const auto payload = vx::Payload::decode({data, size});
  if (!payload) return 0;
  for (const auto& [key, value] : *payload) walk(value);
  std::string json;
  vx::appendPrettyJson(json, *payload, 0);
  require(vx::Payload::decode(vx::PayloadBuilder(*payload).build().encoded()).has_value());
  return 0;
}
