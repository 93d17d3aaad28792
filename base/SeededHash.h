// Hashes of texts that clients choose.
#pragma once

#include <cstddef>
#include <cstdint>
#include <random>
#include <string_view>

#include "base/Bytes.h"

namespace vx {

// Seeded by chance in each process: who could guess the hashes could make texts all fall together.
inline uint64_t seededHash(std::string_view text) {
  static const uint64_t seed = std::random_device()() | uint64_t{std::random_device()()} << 32;
  uint64_t hash = seed ^ text.size();
  forEachWord(bytesOf(text), text.size(), [&](uint64_t word) {
    const auto product = static_cast<unsigned __int128>(hash ^ word) * 0x9E3779B97F4A7C15u;
    hash = static_cast<uint64_t>(product) ^ static_cast<uint64_t>(product >> 64) ^ seed;
  });
  return hash ^ hash >> 32;
}

// For the containers of the standard library.
struct SeededHash {
  std::size_t operator()(std::string_view text) const { return seededHash(text); }
};

}  // namespace vx
