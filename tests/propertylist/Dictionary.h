#pragma once

#include "propertylist/Payload.h"

namespace vx {

inline void setAll(PayloadBuilder&) {}

template <class V, class... Rest>
void setAll(PayloadBuilder& builder, std::string_view key, const V& value, const Rest&... rest) {
  builder.set(key, value);
  setAll(builder, rest...);
}

// dictionary("a", 1, "b", "x"): {a=1,b=x}
template <class... Entries>
Payload dictionary(const Entries&... entries) {
  PayloadBuilder builder;
  setAll(builder, entries...);
  return builder.build();
}

}  // namespace vx
