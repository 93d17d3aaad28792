#include <algorithm>

#include "Statistics/Service/VXReportingServiceProtocol.h"
#include "tests/wire/SocketEnd.h"
#include "wire/FrameReader.h"
#include "wire/Operations.h"

namespace vx::wire {
namespace {

using Next = FrameReader::Next;

// One read of the stream, as far as the space goes; the bytes' number.
std::size_t feed(FrameReader& reader, std::span<const uint8_t> stream) {
  const std::span<uint8_t> space = reader.space();
  const std::size_t size = std::min(space.size(), stream.size());
  std::copy_n(stream.begin(), size, space.begin());
  reader.received(size);
  return size;
}

// What a reader makes of a stream whose first read ends at `cut`, when it takes at most so many
// frames after each read. `shared`: another connection reads in between.
std::vector<Bytes> readAll(std::span<const uint8_t> stream, std::size_t cut, int most,
                           bool shared) {
  ReadBuffers buffers;
  FrameReader reader(buffers);
  FrameReader other(buffers);
  std::vector<Bytes> got;
  std::span<const uint8_t> body;
  for (std::size_t at = 0; at < stream.size() || reader.hasNext();) {
    at += feed(reader, at < cut ? stream.first(cut) : stream.subspan(at));
    for (int i = 0; i < most && reader.next(body) == Next::Frame; ++i)
      got.emplace_back(body.begin(), body.end());
    if (!shared) continue;
    reader.keepRest();
    feed(other, Bytes(ReadBuffers::kReadBytes, 0xEE));
    other.clear();
    (void)reader.space();  // a read that takes nothing
  }
  EXPECT_EQ(reader.unread(), 0U);
  return got;
}

TEST(FrameReader, FramesComeWholeWhereverTheStreamIsCut) {
  std::vector<Bytes> bodies{Bytes(3, 1), {}, Bytes(300, 2), {3}, Bytes(200000, 7), Bytes(6, 2)};
  for (uint8_t i = 0; i < 250; ++i) bodies.emplace_back(500, i);
  Bytes stream;
  for (const Bytes& body : bodies) stream = stream + framed(body);
  for (std::size_t cut = 0; cut < 320; cut += cut < 20 ? 1 : 3)
    for (const int most : {1, 3, 1000})
      for (const bool shared : {false, true})
        EXPECT_TRUE(readAll(stream, cut, most, shared) == bodies) << cut << most << shared;
}

TEST(FrameReader, ALengthAboveTheLimitIsRefusedBeforeTheBodyComes) {
  ReadBuffers buffers;
  FrameReader reader(buffers);
  std::span<const uint8_t> body;
  reader.setLimit(100);
  feed(reader, Bytes{101, 0, 0});
  EXPECT_EQ(reader.next(body), Next::Incomplete);
  feed(reader, Bytes{1});
  EXPECT_TRUE(reader.hasNext());
  EXPECT_EQ(reader.next(body), Next::TooLarge);
  EXPECT_EQ(reader.nextLength(), (1U << 24) + 101);
}

// Neither side sees the other: the service describes its operations, clients know their numbers.
TEST(Operations, ClientsAndServiceMeanTheSameNumbers) {
  const auto& described = vxReportingServiceInterface().operations;
  ASSERT_EQ(described.size(), kOperationNames.size());
  for (std::size_t i = 0; i < described.size(); ++i)
    EXPECT_EQ(described[i].name, kOperationNames[i]) << "operation " << i + 1;
}

}  // namespace
}  // namespace vx::wire
