#include <gtest/gtest.h>

#include <algorithm>
#include <bit>
#include <charconv>
#include <chrono>
#include <cmath>
#include <filesystem>
#include <fstream>
#include <limits>
#include <random>
#include <sstream>

#include "propertylist/CborWriter.h"
#include "propertylist/Payload.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

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

// {"v": item}
std::string wrapped(const std::string& item) { return "a16176" + item; }

// Why the bytes are refused; empty when they are not.
template <class Decoded = Payload>
std::string refusal(const std::string& hex) {
  DecodeError error;
  const Bytes bytes = fromHex(hex);
  return Decoded::decode(bytes, &error) ? "" : error.text;
}

std::string repeated(int count, const std::string& text) {
  std::string out;
  for (int i = 0; i < count; ++i) out += text;
  return out;
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
    DecodeError error;
    const auto payload = Payload::decode(fromHex(wrapped(hex)), &error);
    ASSERT_EQ(payload.has_value(), kind != "refused") << error.text;
    if (!payload) {
      EXPECT_EQ(error.text, text);
      continue;
    }
    const Value value = *payload->find("v");
    EXPECT_EQ(kKinds[static_cast<int>(value.kind())], kind);
    EXPECT_EQ(value.text(), text);
    EXPECT_TRUE(std::ranges::equal(value.encoded(), fromHex(hex)));
  }
  EXPECT_EQ(count, 83);
}

TEST(Payload, RefusesWhatIsNotOneWholeDictionary) {
  EXPECT_EQ(refusal("80"), "not a dictionary");
  EXPECT_EQ(refusal("a000"), "bytes behind the end");
  EXPECT_EQ(refusal("a1617b"), "ends too early");
  EXPECT_EQ(refusal("a1617bff"), "break without an indefinite length");
  EXPECT_EQ(refusal("a1617b1c"), "reserved head");
  for (const char* nonFinite : {"f97e00", "fa7f800000", "fbfff0000000000000"})
    EXPECT_EQ(refusal(wrapped("c1" + std::string(nonFinite))), "date is not finite");
  EXPECT_EQ(refusal(wrapped("c16161")), "date is not a number");
  EXPECT_EQ(refusal(wrapped("c13bffffffffffffffff")), "integer below the signed 64-bit range");
  EXPECT_EQ(refusal<Frame>("a0"), "not an array");
  EXPECT_EQ(refusal<Frame>("8100f6"), "bytes behind the end");
  EXPECT_EQ(refusal<Frame>("82f681f6"), "null") << "an absent argument is the frame's own element";
  EXPECT_EQ(refusal<Frame>("81a16176f6"), "null");
  const std::string whole = "a3616101616282fb3ff199999999999a636162636163c11a514b67b0";
  ASSERT_EQ(refusal(whole), "");
  for (std::size_t size = 0; size < whole.size(); size += 2)
    EXPECT_NE(refusal(whole.substr(0, size)), "") << size;
}

TEST(Payload, BelievesNoCountBeyondTheBytesLeft) {
  const std::string tooMany = "count larger than the bytes left";
  EXPECT_EQ(refusal("bbffffffffffffffff"), tooMany);
  EXPECT_EQ(refusal("bb8000000000000000" + repeated(8, "00")), tooMany);
  EXPECT_EQ(refusal(wrapped("9a7fffffff")), tooMany);
  EXPECT_EQ(refusal(wrapped("820102")), "");
  EXPECT_EQ(refusal(wrapped("830102")), tooMany);
  EXPECT_EQ(refusal("a2616100"), tooMany) << "an entry is two bytes at least";
  EXPECT_EQ(refusal(wrapped("7bffffffffffffffff61")), "ends too early");
}

TEST(Payload, BoundsTheNesting) {
  const auto nested = [](int levels) {  // the dictionary itself is one
    return wrapped(repeated(levels - 1, "81") + "00");
  };
  EXPECT_EQ(refusal(nested(32)), "");
  EXPECT_EQ(refusal(nested(33)), "nesting deeper than 32");
  EXPECT_EQ(refusal(nested(100000)), "nesting deeper than 32");
  EXPECT_EQ(refusal<Frame>("81" + nested(32)), "") << "a frame carries every payload";
  EXPECT_EQ(refusal<Frame>("81" + nested(33)), "nesting deeper than 32");
}

TEST(Payload, RefusesInvalidUtf8) {
  for (const char* bytes : {"80", "c080", "c1bf", "e08080", "eda080", "edbfbf", "f0808080",
                            "f4908080", "f5808080", "ff", "e282", "f09f98", "c328"}) {
    const std::string text = repeated(10, "61") + bytes;  // beyond the first word
    const std::string head = {'6', "0123456789abcdef"[text.size() / 2]};
    EXPECT_EQ(refusal(wrapped(head + text)), "invalid UTF-8") << bytes;
    EXPECT_EQ(refusal("a1" + head + text + "00"), "invalid UTF-8") << bytes;
  }
  EXPECT_EQ(refusal(wrapped("6cf48fbfbfee8080efbfbfc280")), "");
}

TEST(Payload, RefusesDuplicateKeysAtAnyDepthAndSize) {
  EXPECT_EQ(refusal("a2616101616202"), "");
  EXPECT_EQ(refusal("a2616101616102"), "duplicate key \"a\"");
  EXPECT_EQ(refusal("a261610178016102"), "duplicate key \"a\"") << "another head, the same key";
  EXPECT_EQ(refusal(wrapped("81a2616101616102")), "duplicate key \"a\"");
  EXPECT_EQ(refusal("a26161a1616101616201"), "") << "the same key on two levels";
  const Payload alike =
      PayloadBuilder().set("aaaaaaaaaaaaaaaa", 1).set("caaaaaaaaaa`aaaa", 2).build();
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
  const Payload p = PayloadBuilder()
                        .set("huge", kHuge)
                        .set("-huge", -kHuge)
                        .set("nan", std::numeric_limits<float>::quiet_NaN())
                        .set("frac", -3.9)
                        .set("2^63", 0x1p63)
                        .set("max", std::numeric_limits<uint64_t>::max())
                        .set("min", std::numeric_limits<int64_t>::min())
                        .set("yes", true)
                        .set("date", PayloadDate{12.5})
                        .set("text", "5")
                        .build();
  const auto at = [&](const char* key) { return *p.find(key); };
  EXPECT_EQ(at("huge").asInt64(), std::numeric_limits<int64_t>::max());
  EXPECT_EQ(at("-huge").asInt64(), std::numeric_limits<int64_t>::min());
  EXPECT_EQ(at("-huge").asUInt64(), 0u);
  EXPECT_EQ(at("huge").asFloat(), std::numeric_limits<float>::max());
  EXPECT_EQ(at("nan").asInt64(), 0);
  EXPECT_EQ(at("frac").asInt64(), -3);
  EXPECT_EQ(at("2^63").asInt64(), std::numeric_limits<int64_t>::max());
  EXPECT_EQ(at("2^63").asUInt64(), uint64_t{1} << 63);
  EXPECT_EQ(at("max").asInt64(), std::numeric_limits<int64_t>::max());
  EXPECT_EQ(at("min").asInt64(), std::numeric_limits<int64_t>::min());
  EXPECT_EQ(at("min").asUInt64(), 0u);
  EXPECT_TRUE(at("min").asBool());
  EXPECT_EQ(at("date").asUInt64(), 12u);
  EXPECT_FALSE(at("date").isNumber());
  EXPECT_EQ(at("yes").asDouble(), 1.0);
  EXPECT_FALSE(at("yes").isNumber());
  EXPECT_EQ(at("date").asInt64(), 12);
  EXPECT_EQ(at("text").asInt64(), 0);
  EXPECT_TRUE(at("frac").asBool());
  EXPECT_FALSE(at("text").asBool());
  EXPECT_TRUE(at("text").asArray().empty());
}

TEST(Value, TextOfDates) {
  const auto text = [](double seconds) {
    return PayloadBuilder().set("d", PayloadDate{seconds}).build().find("d")->text();
  };
  EXPECT_EQ(text(0), "1970-01-01T00:00:00Z");
  EXPECT_EQ(text(-0.25), "1969-12-31T23:59:59.75Z");
  EXPECT_EQ(text(1795232760.1), "2026-11-21T03:46:00.1Z");
  EXPECT_EQ(text(951782400), "2000-02-29T00:00:00Z");
  EXPECT_EQ(text(-62162208000), "0000-02-28T00:00:00Z");
  EXPECT_EQ(text(-62167219199), "0000-01-01T00:00:01Z");
  EXPECT_EQ(text(253402300799), "9999-12-31T23:59:59Z");
  EXPECT_EQ(text(1767225600.05), "2026-01-01T00:00:00.05Z");
  EXPECT_EQ(text(0x1p60), "1152921504606846976");
  EXPECT_EQ(Payload::decode(fromHex(wrapped("c11b0fffffffffffffff")))->find("v")->text(),
            "1152921504606846975");
  EXPECT_EQ(text(253402300800), "253402300800");
  EXPECT_EQ(text(1e300), "1e+300");
  EXPECT_EQ(text(5e-324), "1970-01-01T00:00:00Z");
  EXPECT_EQ(text(std::numeric_limits<double>::quiet_NaN()), "1970-01-01T00:00:00Z");
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
  const Bytes bytes = fromHex(
      "8a07a1636120620"
      "1a1616ea16363206401"
      "81a16365206602"
      "a0"
      "f6"
      "6178"
      "a1616701"
      "09"
      "0a");
  const Frame frame = *Frame::decode(bytes);
  EXPECT_EQ(frame.size(), 10u);
  const char* texts[] = {"7", "{a b=1}", "{n={c d=1}}", "({e f=2})", "{}", "null", "x", "{g=1}"};
  for (std::size_t i = 0; i < Frame::kMaxElements; ++i) EXPECT_EQ(frame[i].text(), texts[i]);
  for (const std::size_t i : {1u, 2u, 4u, 7u}) {
    EXPECT_EQ(frame.payload(i), Payload::copyOf(frame[i]));
    EXPECT_EQ(frame.payload(i).hasSpaceInKeys(), i == 1);
  }
}

TEST(PayloadBuilder, MakesAValidPayloadOfAnything) {
  Bytes frame = fromHex("82f601");
  const Value null = (*Frame::decode(frame))[0];
  const Payload p = PayloadBuilder()
                        .set("bad\xFFkey", "half\xE2\x82")
                        .set("bad\xFEkey", 1)  // the same key, once it is text
                        .set("null", null)
                        .set("list", ArrayBuilder().add("\xC0").add(null))
                        .set("three", std::string("a\xC3(b\xED\xA0\x80"))
                        .set("long", std::string(70000, 'x'))
                        .set("256", std::string(256, 'y'))
                        .set("days", PayloadDate{1795232760})
                        .build();
  ASSERT_TRUE(Payload::decode(p.encoded()).has_value());
  EXPECT_EQ(p.size(), 6u);
  EXPECT_EQ(p.find("three")->asString(), "a\uFFFD(b\uFFFD\uFFFD\uFFFD");
  EXPECT_EQ(p.find("days")->encoded().size(), 6u) << "whole seconds are an integer";
  EXPECT_EQ(p.find("bad\uFFFDkey")->asInt64(), 1);
  EXPECT_EQ(p.find("list")->text(), "(\uFFFD)");
}

// Whatever way a number's text is found, it is the one that reads back and that is the shortest.
TEST(Value, TextOfDoublesIsTheShortestThatReadsBack) {
  std::mt19937_64 random(7);
  const auto textOf = [](double value) {
    return PayloadBuilder().set("v", value).build().find("v")->text();
  };
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
  const Payload value = PayloadBuilder().set("v", 7).build();
  PayloadBuilder many;
  for (int i = 0; i < 23; ++i) many.set("k" + std::to_string(i), i);
  for (const Payload& from : {Payload(), value, many.build()}) {
    for (const char* key : {"v", "a b", "k3"}) {
      const Payload with = from.withEntry(key, *value.find("v"));
      const Payload built = PayloadBuilder(from).set(key, 7).build();
      EXPECT_EQ(with, built);
      EXPECT_FALSE(with.isSameObject(built));
      EXPECT_EQ(with.hasSpaceInKeys(), built.hasSpaceInKeys());
      const Payload copy = Payload::copyOf(*PayloadBuilder().set("w", with).build().find("w"));
      EXPECT_EQ(copy, built);
      EXPECT_EQ(copy.hasSpaceInKeys(), key[1] == ' ');
    }
  }
}

TEST(PayloadBuilder, JoinsTextsFromPieces) {
  const std::string large(70000, 'x');
  const PayloadBuilder::JoinedText texts[] = {
      {"a b", {"1", ",", "\xC3", "\xBC"}}, {"none", {}}, {"large", {large, ",", large}}};
  const Payload joined = PayloadBuilder::joined(texts);
  EXPECT_EQ(joined, PayloadBuilder()
                        .set("a b", "1,\u00FC")
                        .set("none", "")
                        .set("large", large + "," + large)
                        .build());
  EXPECT_TRUE(joined.hasSpaceInKeys());
  EXPECT_TRUE(PayloadBuilder::joined({}).empty());
}

TEST(Payload, KnowsWhetherANumberMayNotBeFinite) {
  const Payload finite = PayloadBuilder().set("a", ArrayBuilder().add(1.5)).build();
  const Payload nested =
      PayloadBuilder().set("n", PayloadBuilder().set("x", std::nanf("")).build()).build();
  const Payload listed = PayloadBuilder().set("l", ArrayBuilder().add(HUGE_VAL)).build();
  EXPECT_FALSE(finite.mayHoldNonFinite());
  for (const Payload& payload :
       {nested, listed, PayloadBuilder(nested).set("b", 1).build(),
        finite.withEntry("n", *nested.find("n")),
        Payload::copyOf(*PayloadBuilder().set("w", listed).build().find("w")),
        *Payload::decode(nested.encoded())}) {
    EXPECT_TRUE(payload.mayHoldNonFinite()) << payload.text();
  }
  Bytes frame = fromHex("83");  // [nested, finite, finite]
  for (const Payload& payload : {nested, finite, finite})
    frame.insert(frame.end(), payload.encoded().begin(), payload.encoded().end());
  const Frame decoded = *Frame::decode(frame);
  EXPECT_TRUE(decoded.payload(0).mayHoldNonFinite());
  EXPECT_FALSE(decoded.payload(1).mayHoldNonFinite());
  EXPECT_FALSE(decoded.payload(2).mayHoldNonFinite());
}

TEST(Payload, TheFuzzersCorpusHoldsNoSurprise) {
  std::size_t files = 0;
  for (const auto& entry : std::filesystem::directory_iterator(VX_FUZZ_CORPUS "/payload")) {
    std::ifstream in(entry.path(), std::ios::binary);
    const Bytes bytes((std::istreambuf_iterator<char>(in)), {});
    SCOPED_TRACE(entry.path());
    EXPECT_EQ(LLVMFuzzerTestOneInput(bytes.data(), bytes.size()), 0);
    ++files;
  }
  EXPECT_GE(files, 20u);
}

}  // namespace
}  // namespace vx
