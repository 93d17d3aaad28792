#include <gtest/gtest.h>

#include <algorithm>
#include <bit>
#include <charconv>
#include <chrono>
#include <cmath>
#include <fstream>
#include <limits>
#include <random>
#include <span>
#include <sstream>

#include "propertylist/CborWriter.h"
#include "propertylist/Payload.h"
#include "tests/propertylist/Dictionary.h"

namespace vx {
namespace {

using Bytes = std::vector<uint8_t>;

Bytes fromHex(std::string_view hex) {
  Bytes bytes;
  for (std::size_t i = 0; i + 1 < hex.size(); i += 2) {
    bytes.push_back(0);
    std::from_chars(hex.data() + i, hex.data() + i + 2, bytes.back(), 16);
  }
  return bytes;
}

// Why the bytes are refused; empty when they are not.
template <class Decoded = Payload>
std::string refusal(std::span<const uint8_t> bytes) {
  DecodeError error;
  return Decoded::decode(bytes, &error) ? "" : error.text;
}

constexpr const char* kKinds[] = {"integer", "unsigned", "float", "double",     "boolean",
                                  "string",  "date",     "array", "dictionary", "null"};

TEST(Payload, DecodesOrRefusesTheKnownVectors) {
  std::ifstream file(VX_CBOR_VECTORS);
  std::string hex, kind, text;
  int count = 0;
  for (std::string line; std::getline(file, line); ++count) {
    SCOPED_TRACE(line);
    if (line[0] == '#') continue;
    std::istringstream words(line);
    words >> hex >> kind;
    words.ignore();
    if (!std::getline(words, text)) text.clear();
    const Bytes bytes = fromHex(hex), item = fromHex("a16176" + hex);  // {"v": item}
    if (kind == "payload" || kind == "refused") {
      EXPECT_EQ(refusal(kind == "payload" ? bytes : item), text);
      continue;
    }
    if (kind == "frame") {
      EXPECT_EQ(refusal<Frame>(bytes), text);
      continue;
    }
    const auto payload = Payload::decode(item);
    ASSERT_TRUE(payload.has_value());
    const Value value = *payload->find("v");
    EXPECT_EQ(kKinds[static_cast<int>(value.kind())], kind);
    EXPECT_EQ(value.text(), text);
    EXPECT_TRUE(std::ranges::equal(value.encoded(), bytes));
  }
  EXPECT_EQ(count, 159);
  const Bytes whole = fromHex("a3616101616282fb3ff199999999999a636162636163c11a514b67b0");
  for (std::size_t size = 0; size <= whole.size(); ++size)
    EXPECT_EQ(refusal(std::span(whole).first(size)).empty(), size == whole.size()) << size;
}

TEST(Payload, RefusesDuplicateKeysAtAnyDepthAndSize) {
  const Payload alike = dictionary("aaaaaaaaaaaaaaaa", 1, "caaaaaaaaaa`aaaa", 2);
  EXPECT_TRUE(Payload::decode(alike.encoded()).has_value()) << "alike at a glance, but different";
  const auto many = [](int count, int lastKey) {
    Bytes bytes;
    CborWriter writer(bytes);
    writer.dictionary(static_cast<uint64_t>(count));
    for (int i = 0; i < count; ++i) {
      writer.string("same start " + std::to_string(i + 1 < count ? i : lastKey) + " same end");
      writer.dictionary(1);  // its key comes between those of the outer one
      writer.string("same start 3 same end");
      writer.boolean(true);
    }
    return bytes;
  };
  for (const int count : {16, 17, 1000}) {
    EXPECT_TRUE(Payload::decode(many(count, count)).has_value()) << count;
    DecodeError error;
    EXPECT_FALSE(Payload::decode(many(count, 7), &error).has_value()) << count;
    EXPECT_EQ(error.text, "duplicate key \"same start 7 same end\"");
    EXPECT_GT(error.offset, many(count - 1, 0).size() - 30) << "the later one is at fault";
  }
}

TEST(Value, ConvertsWithinTheRangeOfTheAsked) {
  constexpr double kHuge = 1e300;
  const Payload p = dictionary(
      "huge", kHuge, "-huge", -kHuge, "nan", std::numeric_limits<float>::quiet_NaN(), "frac", -3.9,
      "2^63", 0x1p63, "max", std::numeric_limits<uint64_t>::max(), "min",
      std::numeric_limits<int64_t>::min(), "yes", true, "date", PayloadDate{12.5}, "text", "5");
  const auto at = [&](const char* key) { return *p.find(key); };
  const std::pair<const char*, int64_t> integers[] = {
      {"huge", INT64_MAX}, {"-huge", INT64_MIN}, {"nan", 0},   {"frac", -3}, {"2^63", INT64_MAX},
      {"max", INT64_MAX},  {"min", INT64_MIN},   {"date", 12}, {"text", 0}};
  for (const auto& [key, value] : integers) EXPECT_EQ(at(key).asInt64(), value) << key;
  const std::pair<const char*, uint64_t> unsignedOnes[] = {
      {"-huge", 0}, {"2^63", uint64_t{1} << 63}, {"min", 0}, {"date", 12}};
  for (const auto& [key, value] : unsignedOnes) EXPECT_EQ(at(key).asUInt64(), value) << key;
  EXPECT_EQ(at("huge").asFloat(), std::numeric_limits<float>::max());
  EXPECT_EQ(at("yes").asDouble(), 1.0);
  for (const char* key : {"date", "yes", "text"}) EXPECT_FALSE(at(key).isNumber()) << key;
  for (const char* key : {"min", "frac", "text"}) EXPECT_EQ(at(key).asBool(), key[0] != 't');
  EXPECT_TRUE(at("text").asArray().empty());
}

// Against a plain list of pairs, through every way the builder keeps its entries: few, indexed,
// replaced in place, moved to the end, compacted.
TEST(PayloadBuilder, ReplacesValuesAndKeepsTheirPlace) {
  std::mt19937 random(20261121);
  for (const unsigned keys : {3u, 16u, 17u, 300u}) {
    PayloadBuilder builder;
    std::vector<std::pair<std::string, std::string>> model;
    for (int step = 0; step < 3000; ++step) {
      const std::string key = "k" + std::to_string(random() % keys);
      const std::string value(random() % 40, static_cast<char>('a' + random() % 26));
      builder.set(key, value);
      const auto found = std::ranges::find(model, key, &decltype(model)::value_type::first);
      if (found == model.end())
        model.emplace_back(key, value);
      else
        found->second = value;
      if (step % 100 != 0) continue;
      const Payload built = builder.build();
      ASSERT_TRUE(Payload::decode(built.encoded()).has_value());
      ASSERT_EQ(built.size(), model.size());
      std::size_t i = 0;
      for (const auto& [k, v] : built) {
        EXPECT_EQ(k, model[i].first);
        EXPECT_EQ(v.asString(), model[i++].second);
      }
    }
  }
}

TEST(Frame, ElementsAreWhereTheyWere) {
  // [7, {"a b": 1}, {"n": {"c d": 1}}, [{"e f": 2}], {}, null, "x", {"g": 1}, 9, 10]
  const Bytes bytes =
      fromHex("8a07a16361206201a1616ea1636320640181a16365206602a0f66178a1616701090a");
  const Frame frame = *Frame::decode(bytes);
  EXPECT_EQ(frame.size(), 10u);
  const char* texts[] = {"7", "{a b=1}", "{n={c d=1}}", "({e f=2})", "{}", "null", "x", "{g=1}"};
  for (std::size_t i = 0; i < Frame::kMaxElements; ++i) EXPECT_EQ(frame[i].text(), texts[i]);
  for (const std::size_t i : {1u, 2u, 4u, 7u}) {
    EXPECT_EQ(frame.payload(i), Payload::copyOf(frame[i]));
    EXPECT_EQ(frame.payload(i).hasSpaceInKeys(), i == 1);
  }
}

TEST(PayloadBuilder, MakesAValidPayloadOfAnythingAndJoinsTextsFromPieces) {
  Bytes frame = fromHex("82f601");
  const Value null = (*Frame::decode(frame))[0];
  const std::string large(70000, 'x');
  const Payload p =
      dictionary("bad\xFFkey", "half\xE2\x82", "bad\xFEkey", 1,  // the same key, once it is text
                 "null", null, "list", ArrayBuilder().add("\xC0").add(null), "three",
                 "a\xC3(b\xED\xA0\x80", "long", large, "256", std::string(256, 'y'), "days",
                 PayloadDate{1795232760}, "never", PayloadDate{std::nan("")});
  ASSERT_TRUE(Payload::decode(p.encoded()).has_value());
  EXPECT_EQ(p.size(), 7u);
  EXPECT_EQ(p.find("never")->text(), "1970-01-01T00:00:00Z");
  EXPECT_EQ(p.find("three")->asString(), "a\uFFFD(b\uFFFD\uFFFD\uFFFD");
  EXPECT_EQ(p.find("days")->encoded().size(), 6u) << "whole seconds are an integer";
  EXPECT_EQ(p.find("bad\uFFFDkey")->asInt64(), 1);
  EXPECT_EQ(p.find("list")->text(), "(\uFFFD)");
  const PayloadBuilder::JoinedText texts[] = {
      {"a b", {"1", ",", "\xC3", "\xBC"}}, {"none", {}}, {"large", {large, ",", large}}};
  const Payload joined = PayloadBuilder::joined(texts);
  EXPECT_EQ(joined, dictionary("a b", "1,\u00FC", "none", "", "large", large + "," + large));
  EXPECT_TRUE(joined.hasSpaceInKeys());
  EXPECT_TRUE(PayloadBuilder::joined({}).empty());
}

// Whatever way a number's text is found, it is the one that reads back and that is the shortest.
TEST(Value, TextOfDoublesIsTheShortestThatReadsBack) {
  std::mt19937_64 random(7);
  const auto textOf = [](double value) { return dictionary("v", value).find("v")->text(); };
  for (int i = 0; i < 100000; ++i) {
    const double decimals = std::pow(10.0, static_cast<double>(random() % 14));
    const double whole = static_cast<double>(random() % (uint64_t{1} << (1 + random() % 52)));
    const double fraction = static_cast<double>(random() % 4096) / 4096.0;
    const auto bits = std::bit_cast<double>(random());
    for (const double value : {whole / decimals, -whole / decimals, fraction + whole, bits,
                               std::nextafter(whole / decimals, HUGE_VAL)}) {
      if (!std::isfinite(value) || std::trunc(value) == value) continue;
      char expected[64];
      const auto* end = std::to_chars(expected, expected + sizeof expected, value).ptr;
      ASSERT_EQ(textOf(value), std::string_view(expected, end));
    }
  }
}

TEST(Payload, OneEntryMoreIsWhatTheBuilderMakes) {
  const Payload value = dictionary("v", 7);
  PayloadBuilder many;
  for (int i = 0; i < 23; ++i) many.set("k" + std::to_string(i), i);
  for (const Payload& from : {Payload(), value, many.build()}) {
    for (const char* key : {"v", "a b", "k3"}) {
      const Payload with = from.withEntry(key, *value.find("v"));
      const Payload built = PayloadBuilder(from).set(key, 7).build();
      EXPECT_EQ(with, built);
      EXPECT_FALSE(with.isSameObject(built));
      EXPECT_EQ(with.hasSpaceInKeys(), built.hasSpaceInKeys());
      const Payload copy = Payload::copyOf(*dictionary("w", with).find("w"));
      EXPECT_EQ(copy, built);
      EXPECT_EQ(copy.hasSpaceInKeys(), key[1] == ' ');
    }
  }
}

TEST(Payload, KnowsWhetherANumberMayNotBeFinite) {
  const Payload finite = dictionary("a", ArrayBuilder().add(1.5));
  const Payload nested = dictionary("n", dictionary("x", std::nanf("")));
  const Payload listed = dictionary("l", ArrayBuilder().add(HUGE_VAL));
  EXPECT_FALSE(finite.mayHoldNonFinite());
  for (const Payload& payload :
       {nested, listed, PayloadBuilder(nested).set("b", 1).build(),
        finite.withEntry("n", *nested.find("n")),
        Payload::copyOf(*dictionary("w", listed).find("w")), *Payload::decode(nested.encoded())}) {
    EXPECT_TRUE(payload.mayHoldNonFinite()) << payload.text();
  }
  Bytes frame = fromHex("83");  // [nested, finite, finite]
  for (const Payload& payload : {nested, finite, finite})
    frame.insert(frame.end(), payload.encoded().begin(), payload.encoded().end());
  const Frame decoded = *Frame::decode(frame);
  for (const std::size_t i : {0u, 1u, 2u}) EXPECT_EQ(decoded.payload(i).mayHoldNonFinite(), i == 0);
}

}  // namespace
}  // namespace vx
