#include "benchmarks/Workload.h"

#include <cstdio>
#include <string>

namespace vx::bench {

Payload workloadPayload(uint64_t seed) {
  uint64_t state = seed * 0x9E3779B97F4A7C15ull + 1;
  auto next = [&state] {
    state ^= state << 13;
    state ^= state >> 7;
    state ^= state << 17;
    return state;
  };
  char route[24];
  char codec[24];
  std::snprintf(route, sizeof route, "route-%010u", static_cast<unsigned>(next()));
  std::snprintf(codec, sizeof codec, "codec-%010u", static_cast<unsigned>(next()));
  return PayloadBuilder()
      .set("sample_rate_hz", static_cast<int64_t>(44100 + next() % 4000))
      .set("frames_rendered", static_cast<int64_t>(next() >> 34))
      .set("buffer_underruns", static_cast<int64_t>(next() % 20))
      .set("output_latency_ms", static_cast<double>(next() % 100000) / 1024.0)
      .set("peak_level_db", -static_cast<double>(next() % 60000) / 1000.0)
      .set("output_route_name", std::string(route, 16))
      .set("active_codec_name", std::string(codec, 16))
      .set("is_spatialized", (next() & 1) != 0)
      .build();
}

std::vector<Payload> workloadPayloads(std::size_t count) {
  std::vector<Payload> payloads;
  for (std::size_t i = 0; i < count; ++i) payloads.push_back(workloadPayload(i + 1));
  return payloads;
}

std::size_t callBytes(const Payload& payload) {
  // length, array head, kind, number (5 bytes once it passes 65535), operation, payload, category,
  // type, null
  return 4 + 1 + 1 + 5 + 1 + payload.encoded().size() + 5 + 1 + 1;
}

}  // namespace vx::bench
