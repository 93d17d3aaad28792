// The aggregate of a session against a list of payloads, and the summaries against the
// straightforward way to make them.
#include <bit>
#include <cmath>
#include <ctime>
#include <random>

#include "Statistics/Service/VXReportingSummaryEvent.h"
#include "Statistics/Service/VXReportingSummaryFile.h"
#include "base/Bytes.h"
#include "base/ChunkList.h"
#include "propertylist/JsonWriter.h"
#include "propertylist/PlacedPayload.h"
#include "tests/statistics/ServiceFixture.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

namespace vx {
namespace {

struct Received {
  std::optional<MessageKind> kind;
  uint64_t count;
  Payload payload;
};

class AggregateTest : public PlatformTest {
 protected:
  using State = VXReportingAggregate::State;

  // A message of some kind, or an orientation entry, of keys and values that come again and again.
  Received any() {
    std::optional<MessageKind> kind;
    if (below(8) > 0) kind = static_cast<MessageKind>(below(2) == 0 ? kMessageKinds - 1 : below(4));
    if (kind && below(9) == 0) counts_[*kind] += below(3) == 0 ? 1 : uint64_t{1} << below(63);
    return {kind, kind ? ++counts_[*kind] : 0, anyDictionary(0)};
  }
  static void appendTo(VXReportingAggregate& to, const Received& one) {
    if (one.kind)
      to.appendMessage(*one.kind, one.count, one.payload);
    else
      to.appendToFlat(one.payload);
  }
  void append(const Received& one) {
    received.push_back(one);
    appendTo(aggregate, one);
  }
  void append(int rows) {
    for (; rows > 0; --rows) append(any());
  }
  uint32_t below(std::size_t bound) { return static_cast<uint32_t>(random_() % bound); }

  void expectHolds(const VXReportingAggregate& shown, const std::vector<Received>& expected) {
    std::size_t i = 0;
    std::size_t messages = 0;
    shown.forEach([&](const VXReportingRow& row) {
      ASSERT_LT(i, expected.size());
      ASSERT_EQ(row.kind, expected[i].kind) << i;
      ASSERT_TRUE(!row.kind || row.count == expected[i].count) << i;
      ASSERT_EQ(row.payload(), expected[i].payload) << i << " " << row.payload().text();
      messages += row.kind ? 1 : 0;
      ++i;
    });
    EXPECT_EQ(i, expected.size());
    EXPECT_EQ(shown.flatSize(), expected.size());
    EXPECT_EQ(shown.nestedSize(), messages);
  }

  VXReportingAggregate aggregate;
  std::vector<Received> received;

 private:
  Payload anyDictionary(int depth) {
    static const std::vector<std::string> kKeys = {
        "a", "bb", "sample_rate_hz", "quote\"\\", "VX_Session_Summary_Event", "\xC3\xBC", "", "z"};
    PayloadBuilder builder;
    const uint32_t first = below(3);
    for (uint32_t i = below(6); i > 0; --i) {
      const std::string key =
          below(40) == 0 ? "k" + std::to_string(below(5000)) : kKeys[(first + i) % kKeys.size()];
      const uint32_t what = below(depth > 1 ? 7 : 9);
      if (what == 0) builder.set(key, static_cast<int64_t>(random_()) >> below(32));
      if (what == 1) builder.set(key, kDoubles[below(kDoubles.size())]);
      if (what == 2) builder.set(key, static_cast<float>(below(100)) / 8);
      if (what == 3) builder.set(key, below(2) == 0);
      if (what == 4) builder.set(key, PayloadDate{below(100000) / 4.0});
      if (what == 5 || what == 6)
        builder.set(key, std::string(below(50) == 0 ? 3000 : below(12), "xy\n,"[below(4)]));
      if (what == 7)
        builder.set(key, ArrayBuilder().add(below(3)).add("y").add(anyDictionary(depth + 1)));
      if (what == 8) builder.set(key, anyDictionary(depth + 1));
    }
    return builder.build();
  }

  static inline const std::vector<double> kDoubles = {
      0, -0.0, 0.1, 0.5, -12.345, 1e300, 97.65625, 1e-310, 16777217, 44100, -0.001};
  std::mt19937 random_{7};
  std::map<MessageKind, uint64_t> counts_;
};

TEST_F(AggregateTest, IsThereAgainInTheNextProcess) {
  append(3000);
  const State then = aggregate.state();
  const std::vector<Received> before = received;
  append(1000);
  expectHolds(aggregate, received);
  for (const uint32_t surviving : {UINT32_MAX, 2u}) {  // blocks
    p.aggregates.surviving = surviving;
    VXReportingAggregate again;
    for (const Received& one : before) appendTo(again, one);
    const State state = again.state();
    EXPECT_EQ(again.unrecordedBytes() > 0, surviving == 2);
    ASSERT_TRUE(again.restore(state).ok());
    if (surviving == 2) {
      EXPECT_GT(again.flatSize(), 0u);
      EXPECT_LT(again.flatSize(), before.size());
    } else {
      expectHolds(again, before);
    }
  }
  p.aggregates.surviving = UINT32_MAX;
  ASSERT_TRUE(aggregate.restore(then).ok());
  expectHolds(aggregate, before);
  received = before;
  append(1000);
  expectHolds(aggregate, received);
  EXPECT_FALSE(aggregate.restore({true, 77, 10}).ok());
  EXPECT_TRUE(aggregate.isPresent());
  EXPECT_EQ(aggregate.flatSize(), 0u);
  ASSERT_TRUE(aggregate.restore({.present = false}).ok());
  EXPECT_FALSE(aggregate.isPresent());
}

// Blocks go back, and payloads are let go of at once.
// In the short form, whole, inside another value, in a message that has no shape.
TEST_F(AggregateTest, KnowsInTheNextProcessThatANumberIsNotFinite) {
  const double notShort = std::bit_cast<double>(0x7FF8000000000001u);
  Payload manyKeys = dictionary("a", HUGE_VAL);
  for (int i = 0; i < 300; ++i)
    manyKeys = PayloadBuilder(manyKeys).set("k" + std::to_string(i), i).build();
  for (const Payload& message :
       {dictionary("a", 0.5, "b", -HUGE_VAL), dictionary("a", notShort), manyKeys,
        PayloadBuilder().set("a", ArrayBuilder().add(HUGE_VAL)).build(), dictionary("a", 0.5)}) {
    VXReportingAggregate again;
    appendTo(again, {MessageKind{1}, 1, message});
    const bool may = again.mayHoldNonFinite();
    EXPECT_EQ(may, message != dictionary("a", 0.5));
    ASSERT_TRUE(again.restore(again.state()).ok());
    EXPECT_EQ(again.mayHoldNonFinite(), may) << message.text().substr(0, 50);
  }
}

TEST_F(AggregateTest, KeepsNothingThatItNeedNot) {
  append(500);
  const Payload sent = dictionary("a", 1);
  static bool released = false;
  PlacedPayload::setOwner([](void*) { released = true; });
  alignas(8) uint8_t place[64];
  aggregate.appendMessage(1, 1, PlacedPayload::at(place, sent.validated()));
  EXPECT_TRUE(released);
  EXPECT_GT(p.aggregates.held, 2u);
  EXPECT_EQ(aggregate.removeAll()->rows(), 501u);
  EXPECT_EQ(p.aggregates.held, 0u);
  aggregate.appendMessage(1, 2, sent);
  aggregate.appendToFlat(sent);
  EXPECT_EQ(aggregate.flatSize(), 0u);
  aggregate.renew();
  aggregate.appendReference(1, 3, sent);
  aggregate.forEach([&](const VXReportingRow& row) {
    EXPECT_EQ(row.count, 3u);
    EXPECT_TRUE(row.payload().isSameObject(sent));
  });
  EXPECT_EQ(aggregate.state().bytes, 3u);  // its count alone
}

// As they were made before there were rows: by key, one payload after the other.
TEST_F(AggregateTest, SummariesAreThoseOfThePayloads) {
  append(4000);
  for (int i = 0; i < 1200; ++i)  // more shapes than are kept
    append({MessageKind{5}, static_cast<uint64_t>(i) + 1, dictionary("x" + std::to_string(i), i)});
  append({MessageKind{6}, 1, dictionary("large", std::string(200000, '"'), "n", 1)});

  std::vector<std::pair<std::string, std::string>> groups = {{"VX_Session_Summary_Event", "3"}};
  std::string file = "[";
  for (const Received& one : received) {
    for (const auto& [key, value] : one.payload) {
      const auto group =
          std::ranges::find(groups, key, &std::pair<std::string, std::string>::first);
      if (group == groups.end())
        groups.emplace_back(key, value.text());
      else
        group->second += "," + value.text();
    }
    if (!one.kind) continue;
    file += file.size() > 1 ? ",\n {\n  \"" : "\n {\n  \"";
    file += messageIdentifier(*one.kind, one.count) + "\": ";
    appendPrettyJson(file, one.payload, 2);
    file += "\n }";
  }
  PayloadBuilder expected;
  for (const auto& [key, text] : groups) expected.set(key, text);

  VXReportingSummaryEvent event(3);
  aggregate.forEach([&](const VXReportingRow& row) { event.add(row); });
  EXPECT_TRUE(event.build() == expected.build());
  std::optional<Error> error;
  const auto out = p.services.createAtomically("/logs", "name", error);
  VXReportingSummaryFile writer(*out);
  aggregate.forEach([&](const VXReportingRow& row) {
    if (row.kind) writer.message(row);
  });
  EXPECT_EQ(writer.finish(), std::nullopt);
  EXPECT_TRUE(p.services.files.begin()->second == file + "\n]\n");
}

// Zeros, which mean that a block ends, are no reason to believe the half of a record before them.
TEST_F(AggregateTest, NoLengthCutsARowInTwo) {
  p.aggregates.least = 4096;
  p.aggregates.fill = 0;
  std::vector<uint64_t> ends;
  for (int i = 0; i < 12; ++i) {
    append({MessageKind{1}, static_cast<uint64_t>(i) + 1, dictionary("d", i / 4.0, "s", "text")});
    ends.push_back(aggregate.state().bytes);
  }
  for (uint64_t bytes = 1; bytes <= ends.back(); ++bytes) {
    VXReportingAggregate cut;
    const bool ok = cut.restore({true, aggregate.state().aggregate, bytes}).ok();
    const auto whole = std::ranges::count_if(ends, [&](uint64_t end) { return end <= bytes; });
    EXPECT_EQ(cut.flatSize(), ok ? static_cast<std::size_t>(whole) : 0) << bytes;
    EXPECT_TRUE(ok || std::ranges::find(ends, bytes) == ends.end());
  }
}

TEST_F(AggregateTest, WhateverWasLeftIsRefusedOrRead) {
  p.aggregates.least = 4096;
  append(60);
  const State state = aggregate.state();
  std::vector<uint8_t> bytes = {255};  // in blocks of 4096
  for (const auto& block : p.aggregates.find(state.aggregate, state.bytes))
    bytes.insert(bytes.end(), block.bytes, block.bytes + block.size);
  const uint8_t keyTwice[] = {255, 1, 0, 2, 0x61, 'a', 0x61, 'a', 5, 1, 2};
  LLVMFuzzerTestOneInput(keyTwice, sizeof keyTwice);
  for (int i = 0; i < 3000; ++i) {
    std::vector<uint8_t> changed(bytes.begin(), bytes.begin() + 1 + below(bytes.size()));
    for (uint32_t changes = below(4); changes > 0; --changes)
      changed[below(changed.size())] = static_cast<uint8_t>(below(3) == 0 ? below(256) : below(8));
    changed[0] = below(2) == 0 ? 255 : changed[0];
    LLVMFuzzerTestOneInput(changed.data(), changed.size());
  }
}

// Sixteen bytes of ASCII each: the standard library's own hash is one for all of them.
std::vector<std::string> collidingKeys(std::size_t count) {
  constexpr uint64_t kFactor = 0xc6a4a7935bd1e995u;
  uint64_t inverse = kFactor;
  for (int i = 0; i < 6; ++i) inverse *= 2 - kFactor * inverse;
  const auto mix = [](uint64_t value) { return value ^ value >> 47; };
  std::vector<std::string> keys;
  for (uint64_t n = 0; keys.size() < count; ++n) {
    uint64_t words[2] = {};
    for (unsigned i = 0; i < 8; ++i) words[0] |= (n >> 7 * i & 127) << 8 * i;
    const uint64_t first =
        (0xc70f6907u ^ 16 * kFactor ^ mix(words[0] * kFactor) * kFactor) * kFactor;
    words[1] = mix((first ^ 1) * inverse) * inverse;
    if ((words[1] & kHighBits) == 0) keys.emplace_back(reinterpret_cast<char*>(words), 16);
  }
  return keys;
}

TEST_F(AggregateTest, KeysThatWereMadeToCollideTakeNoLongerThanOthers) {
  const std::vector<std::string> colliding = collidingKeys(10000);
  const std::hash<std::string_view> hash;
  ASSERT_EQ(hash(colliding.front()), hash(colliding.back()));
  const auto secondsFor = [](const auto& keyAt) {
    PayloadBuilder keys;
    for (std::size_t i = 0; i < 10000; ++i) keys.set(keyAt(i), 1);
    VXReportingRow row;
    row.dictionary = keys.build();
    const std::clock_t began = std::clock();
    VXReportingSummaryEvent event(3);
    event.add(row);
    EXPECT_GT(event.build().encoded().size(), 10000 * 16u);
    return static_cast<double>(std::clock() - began) / CLOCKS_PER_SEC;
  };
  const double usual =
      secondsFor([](std::size_t i) { return std::to_string(1000000000000000 + i); });
  EXPECT_LT(secondsFor([&](std::size_t i) { return colliding[i]; }), 10 * usual + 0.02);
}

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
