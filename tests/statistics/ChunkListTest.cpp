#include <gtest/gtest.h>

#include <memory>
#include <numeric>
#include <vector>

#include "base/ChunkList.h"

namespace vx {
namespace {

// Chunks of 2, 4, 8, 8...: around every end of one, filled one by one and by the run, used again.
TEST(ChunkList, HoldsWhatAVectorWould) {
  ChunkList<int, 8, 2, 2> list;
  for (const int count : {0, 1, 2, 3, 6, 7, 14, 15, 22, 100, 5}) {
    std::vector<int> expected(static_cast<std::size_t>(count)), held;
    std::iota(expected.begin(), expected.end(), count);
    list.clear();
    if (count % 2 == 0) list.append(expected);
    if (count % 2 != 0)
      for (const int i : expected) list.push_back(i);
    list.forEachChunk([&](auto chunk) { held.insert(held.end(), chunk.begin(), chunk.end()); });
    EXPECT_EQ(held, expected);
    EXPECT_EQ(list.size(), expected.size());
    EXPECT_EQ(list.empty(), count == 0);
  }
}

TEST(ChunkList, DestroysWhatItHeldAndShrinksToWhatItNeeds) {
  const auto token = std::make_shared<int>();
  ChunkList<std::shared_ptr<int>, 4> list;
  for (const std::size_t count : {9u, 4u, 8u}) {
    for (std::size_t i = 0; i < count; ++i) list.push_back(token);
    EXPECT_EQ(list[count - 1], token);
    list.shrink(0);
    EXPECT_EQ(token.use_count(), static_cast<long>(count) + 1);
    ChunkList<std::shared_ptr<int>, 4> other(std::move(list));
    list.swap(other);
    EXPECT_EQ(list.size(), count);
    list.clear();
    EXPECT_EQ(token.use_count(), 1);
  }
  list.push_back(token);
  list = {};
  EXPECT_EQ(token.use_count(), 1);
}

}  // namespace
}  // namespace vx
