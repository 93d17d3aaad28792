// Whatever stream comes, its frames are the same wherever its reads are cut.
#include <algorithm>
#include <cstring>

#include "wire/FrameReader.h"

using vx::wire::FrameReader;

static vx::wire::ReadBuffers buffers;

// The bodies, one behind the other, and how the stream ended.
static std::vector<uint8_t> bodies(const uint8_t* at, std::size_t size, std::size_t cut,
                                   std::size_t more) {
  FrameReader reader(buffers);
  reader.setLimit(1000);
  std::vector<uint8_t> out;
  std::span<const uint8_t> body;
  FrameReader::Next next = FrameReader::Next::Incomplete;
  for (const uint8_t* const end = at + size; at < end;
       at += cut, cut = std::min(cut + more, size)) {
    cut = std::min(cut, static_cast<std::size_t>(end - at));
    const std::span<uint8_t> space = reader.space();
    std::memcpy(space.data(), at, cut);
    reader.received(cut);
    while ((next = reader.next(body)) == FrameReader::Next::Frame) {
      out.push_back(static_cast<uint8_t>(body.size()));
      out.insert(out.end(), body.begin(), body.end());
    }
    if (next == FrameReader::Next::TooLarge) break;
    if (more % 2 == 0) reader.keepRest();
  }
  out.push_back(next == FrameReader::Next::TooLarge);
  return out;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 2 || size > vx::wire::ReadBuffers::kReadBytes) return 0;
  const auto whole = bodies(data + 2, size - 2, size - 2, 0);
  if (bodies(data + 2, size - 2, 1 + data[0], data[1]) != whole) __builtin_trap();
  return 0;
}
