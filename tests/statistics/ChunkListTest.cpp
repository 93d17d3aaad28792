#include <gtest/gtest.h>

#include <memory>
#include <vector>

#include "base/ChunkList.h"

namespace vx {
namespace {

// Chunks of 2, 4, 8, 8...: around every end of one, filled one by one and by the run, used again.
TEST(ChunkList, HoldsWhatAVectorWouldAndNoLonger) {
  using Element = std::shared_ptr<std::size_t>;
  const auto token = std::make_shared<std::size_t>();
  std::vector<std::size_t> numbers(100);
  ChunkList<Element, 8, 2, 2> list;
  for (const std::size_t count : {0u, 1u, 2u, 3u, 6u, 7u, 14u, 15u, 22u, 100u, 5u}) {
    std::vector<Element> expected, held;
    for (std::size_t i = 0; i < count; ++i) expected.emplace_back(token, &numbers[i]);
    list.clear();
    EXPECT_EQ(token.use_count() - 1, static_cast<long>(count));
    if (count % 2 == 0) list.append(expected);
    if (count % 2 != 0)
      for (const Element& element : expected) list.push_back(element);
    list.shrink(0);
    auto other = std::move(list);
    list = std::move(other);
    list.forEachChunk([&](auto chunk) { held.insert(held.end(), chunk.begin(), chunk.end()); });
    EXPECT_EQ(held, expected);
    EXPECT_EQ(list.size(), count);
    EXPECT_EQ(list.empty(), count == 0);
  }
  list = {};
  EXPECT_EQ(token.use_count(), 1);
}

}  // namespace
}  // namespace vx
