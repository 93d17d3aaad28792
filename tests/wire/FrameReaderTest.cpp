#include <gmock/gmock.h>

#include <cstring>

#include "wire/FrameReader.h"
#include "wire/FrameWriter.h"

namespace vx::wire {
namespace {

using Bytes = std::vector<uint8_t>;
using Next = FrameReader::Next;
using testing::ElementsAre;

Bytes body(std::size_t size, uint8_t fill) { return Bytes(size, fill); }

// A frame of that body, whatever it is.
Bytes frame(const Bytes& body) {
  Bytes out(kLengthBytes);
  for (std::size_t i = 0; i < kLengthBytes; ++i)
    out[i] = static_cast<uint8_t>(body.size() >> (8 * i));
  out.insert(out.end(), body.begin(), body.end());
  return out;
}

class FrameReaderTest : public testing::Test {
 protected:
  // One read of the stream, as far as the space goes; the bytes' number.
  static std::size_t feed(FrameReader& reader, std::span<const uint8_t> stream) {
    const std::span<uint8_t> space = reader.space();
    const std::size_t size = std::min(space.size(), stream.size());
    std::memcpy(space.data(), stream.data(), size);
    reader.received(size);
    return size;
  }
  static std::vector<Bytes> take(FrameReader& reader, std::size_t most = SIZE_MAX) {
    std::vector<Bytes> taken;
    std::span<const uint8_t> next;
    while (taken.size() < most && reader.next(next) == Next::Frame)
      taken.emplace_back(next.begin(), next.end());
    return taken;
  }

  ReadBuffers buffers;
  FrameReader reader{buffers};
  FrameReader other{buffers};
};

TEST_F(FrameReaderTest, FramesComeWholeWhereverTheStreamIsCut) {
  const std::vector<Bytes> bodies{body(3, 1), body(0, 0), body(300, 2), body(1, 3)};
  Bytes stream;
  for (const Bytes& b : bodies) {
    const Bytes f = frame(b);
    stream.insert(stream.end(), f.begin(), f.end());
  }
  const std::span<const uint8_t> all(stream);
  const Bytes noise(ReadBuffers::kReadBytes, 0xEE);
  for (std::size_t cut = 0; cut <= stream.size(); ++cut) {
    for (const bool shared : {false, true}) {
      std::vector<Bytes> got;
      feed(reader, all.first(cut));
      for (const Bytes& b : take(reader)) got.push_back(b);
      EXPECT_FALSE(reader.hasNext());
      if (shared) {  // another connection reads in between
        reader.keepRest();
        feed(other, noise);
        other.clear();
      }
      (void)reader.space();  // a read that takes nothing
      feed(reader, all.subspan(cut));
      for (const Bytes& b : take(reader)) got.push_back(b);
      EXPECT_EQ(got, bodies) << cut;
      EXPECT_EQ(reader.unread(), 0U);
      reader.keepRest();
    }
  }
}

TEST_F(FrameReaderTest, FramesLargerThanAReadAreGathered) {
  const Bytes large = body(200000, 7);
  const Bytes stream = [&] {
    Bytes bytes = frame(body(5, 1));
    for (const Bytes& b : {frame(large), frame(body(6, 2)), frame(large)})
      bytes.insert(bytes.end(), b.begin(), b.end());
    return bytes;
  }();
  for (const bool shared : {false, true}) {
    std::vector<Bytes> got;
    for (std::size_t at = 0; at < stream.size();) {
      at += feed(reader, std::span<const uint8_t>(stream).subspan(at));
      // One frame at a time: what must wait is kept as it is.
      for (std::vector<Bytes> one; !(one = take(reader, 1)).empty();) {
        got.push_back(one[0]);
        if (!shared) continue;
        reader.keepRest();
        feed(other, body(1000, 0xEE));
        other.clear();
      }
      if (shared) reader.keepRest();
    }
    EXPECT_EQ(got, (std::vector<Bytes>{body(5, 1), large, body(6, 2), large}));
  }
}

TEST_F(FrameReaderTest, ReadsOnWhileFramesWait) {
  std::vector<Bytes> sent;
  std::vector<Bytes> got;
  Bytes stream;
  for (uint8_t i = 0; i < 250; ++i) {
    const Bytes f = frame(sent.emplace_back(body(2000, i)));
    stream.insert(stream.end(), f.begin(), f.end());
  }
  for (std::size_t at = 0; at < stream.size();) {
    at += feed(reader, std::span<const uint8_t>(stream).subspan(at));
    for (const Bytes& b : take(reader, 3)) got.push_back(b);
  }
  for (const Bytes& b : take(reader)) got.push_back(b);
  EXPECT_EQ(got, sent);
}

TEST_F(FrameReaderTest, TheLimitIsOnTheBody) {
  reader.setLimit(100);
  std::span<const uint8_t> next;
  for (const std::size_t size : {99U, 100U}) {
    feed(reader, frame(body(size, 1)));
    EXPECT_EQ(reader.next(next), Next::Frame) << size;
    EXPECT_EQ(next.size(), size);
  }
  const Bytes tooLarge = frame(body(101, 1));
  feed(reader, std::span<const uint8_t>(tooLarge).first(3));
  EXPECT_FALSE(reader.hasNext());
  EXPECT_EQ(reader.next(next), Next::Incomplete);
  feed(reader, std::span<const uint8_t>(tooLarge).subspan(3, 1));
  EXPECT_TRUE(reader.hasNext()) << "refused before its body comes";
  EXPECT_EQ(reader.next(next), Next::TooLarge);
  EXPECT_EQ(reader.nextLength(), 101U);
  reader.clear();
  feed(reader, Bytes{0, 0, 0, 1});
  EXPECT_EQ(reader.nextLength(), 1U << 24);
}

TEST(FrameWriter, FramesFollowWhatTheBufferHolds) {
  Bytes out{0xAA};
  FrameWriter call = FrameWriter::call(out, 24, Operation::SetServiceType, 2);
  call.items().integer(7);
  call.items().string(std::string(300, 'x'));
  EXPECT_EQ(call.bodyBytes(), out.size() - 1 - kLengthBytes);
  call.end();
  EXPECT_EQ(Bytes(out.begin(), out.begin() + 11),
            (Bytes{0xAA, 0x35, 0x01, 0, 0, 0x85, 1, 0x18, 24, 2, 7}));
  Bytes same = out;
  FrameWriter refused = FrameWriter::reply(same, 1);
  refused.items().boolean(true);
  refused.discard();
  EXPECT_EQ(same, out);
  Bytes error;
  FrameWriter::error(error, std::nullopt, ErrorCode::Abandoned, "x");
  EXPECT_THAT(error, ElementsAre(6, 0, 0, 0, 0x84, 3, 0xf6, 8, 0x61, 'x'));
}

}  // namespace
}  // namespace vx::wire
