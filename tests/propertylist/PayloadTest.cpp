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
std::string refusal(const std::string& hex) {
  DecodeError error;
  const Bytes bytes = fromHex(hex);
  return Payload::decode(bytes, &error) ? "" : error.text;
}

std::string frameRefusal(const std::string& hex) {
  DecodeError error;
  const Bytes bytes = fromHex(hex);
  return Frame::decode(bytes, &error) ? "" : error.text;
}

std::string repeated(int count, const std::string& text) {
  std::string out;
  for (int i = 0; i < count; ++i) out += text;
  return out;
}

struct Vector {
  const char* hex;
  std::optional<ValueKind> kind;  // none: refused
  const char* text;               // of the value, or of the refusal
};

constexpr auto I = ValueKind::Integer;
constexpr auto F = ValueKind::Float;
constexpr auto D = ValueKind::Double;
constexpr auto S = ValueKind::String;
constexpr auto A = ValueKind::Array;
constexpr auto M = ValueKind::Dictionary;
constexpr auto no = std::nullopt;
constexpr const char* kIndefinite = "indefinite length";

// RFC 8949, Appendix A, complete and in its order.
const Vector kVectors[] = {
    {"00", I, "0"},
    {"01", I, "1"},
    {"0a", I, "10"},
    {"17", I, "23"},
    {"1818", I, "24"},
    {"1819", I, "25"},
    {"1864", I, "100"},
    {"1903e8", I, "1000"},
    {"1a000f4240", I, "1000000"},
    {"1b000000e8d4a51000", I, "1000000000000"},
    {"1bffffffffffffffff", ValueKind::Unsigned, "18446744073709551615"},
    {"c249010000000000000000", no, "tag 2"},
    {"3bffffffffffffffff", no, "integer below the signed 64-bit range"},
    {"c349010000000000000000", no, "tag 3"},
    {"20", I, "-1"},
    {"29", I, "-10"},
    {"3863", I, "-100"},
    {"3903e7", I, "-1000"},
    {"f90000", F, "0"},
    {"f98000", F, "0"},
    {"f93c00", F, "1"},
    {"fb3ff199999999999a", D, "1.1"},
    {"f93e00", F, "1.5"},
    {"f97bff", F, "65504"},
    {"fa47c35000", F, "100000"},
    {"fa7f7fffff", F, "3.4028235e+38"},
    {"fb7e37e43c8800759c", D, "1e+300"},
    {"f90001", F, "5.9604645e-08"},
    {"f90400", F, "6.1035156e-05"},
    {"f9c400", F, "-4"},
    {"fbc010666666666666", D, "-4.1"},
    {"f97c00", F, "inf"},
    {"f97e00", F, "nan"},
    {"f9fc00", F, "-inf"},
    {"fa7f800000", F, "inf"},
    {"fa7fc00000", F, "nan"},
    {"faff800000", F, "-inf"},
    {"fb7ff0000000000000", D, "inf"},
    {"fb7ff8000000000000", D, "nan"},
    {"fbfff0000000000000", D, "-inf"},
    {"f4", ValueKind::Boolean, "0"},
    {"f5", ValueKind::Boolean, "1"},
    {"f6", no, "null"},
    {"f7", no, "undefined"},
    {"f0", no, "simple value 16"},
    {"f8ff", no, "simple value 255"},
    {"c074323031332d30332d32315432303a30343a30305a", no, "tag 0"},
    {"c11a514b67b0", ValueKind::Date, "2013-03-21T20:04:00Z"},
    {"c1fb41d452d9ec200000", ValueKind::Date, "2013-03-21T20:04:00.5Z"},
    {"d74401020304", no, "tag 23"},
    {"d818456449455446", no, "tag 24"},
    {"d82076687474703a2f2f7777772e6578616d706c652e636f6d", no, "tag 32"},
    {"40", no, "byte string"},
    {"4401020304", no, "byte string"},
    {"60", S, ""},
    {"6161", S, "a"},
    {"6449455446", S, "IETF"},
    {"62225c", S, "\"\\"},
    {"62c3bc", S, "\u00fc"},
    {"63e6b0b4", S, "\u6c34"},
    {"64f0908591", S, "\U00010151"},
    {"80", A, "()"},
    {"83010203", A, "(1,2,3)"},
    {"8301820203820405", A, "(1,(2,3),(4,5))"},
    {"98190102030405060708090a0b0c0d0e0f101112131415161718181819", A,
     "(1,2,3,4,5,6,7,8,9,10,11,12,13,14,15,16,17,18,19,20,21,22,23,24,25)"},
    {"a0", M, "{}"},
    {"a201020304", no, "key is not a string"},
    {"a26161016162820203", M, "{a=1,b=(2,3)}"},
    {"826161a161626163", A, "(a,{b=c})"},
    {"a56161614161626142616361436164614461656145", M, "{a=A,b=B,c=C,d=D,e=E}"},
    {"5f42010243030405ff", no, kIndefinite},
    {"7f657374726561646d696e67ff", no, kIndefinite},
    {"9fff", no, kIndefinite},
    {"9f018202039f0405ffff", no, kIndefinite},
    {"9f01820203820405ff", no, kIndefinite},
    {"83018202039f0405ff", no, kIndefinite},
    {"83019f0203ff820405", no, kIndefinite},
    {"9f0102030405060708090a0b0c0d0e0f101112131415161718181819ff", no, kIndefinite},
    {"bf61610161629f0203ffff", no, kIndefinite},
    {"826161bf61626163ff", no, kIndefinite},
    {"bf6346756ef563416d7421ff", no, kIndefinite},
};

TEST(Payload, DecodesOrRefusesTheKnownVectors) {
  for (const Vector& vector : kVectors) {
    SCOPED_TRACE(vector.hex);
    DecodeError error;
    const auto payload = Payload::decode(fromHex(wrapped(vector.hex)), &error);
    ASSERT_EQ(payload.has_value(), vector.kind.has_value()) << error.text;
    if (!payload) {
      EXPECT_EQ(error.text, vector.text);
      continue;
    }
    const Value value = *payload->find("v");
    EXPECT_EQ(value.kind(), *vector.kind);
    EXPECT_EQ(value.text(), vector.text);
    EXPECT_TRUE(std::ranges::equal(value.encoded(), fromHex(vector.hex)));
  }
}

TEST(Payload, RefusesWhatIsNotOneWholeDictionary) {
  EXPECT_EQ(refusal("80"), "not a dictionary");
  EXPECT_EQ(refusal("a000"), "bytes behind the end");
  EXPECT_EQ(refusal("a1617b"), "ends too early");
  EXPECT_EQ(refusal("a1617bff"), "break without an indefinite length");
  EXPECT_EQ(refusal("a1617b1c"), "reserved head");
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
  EXPECT_EQ(refusal(wrapped("7bffffffffffffffff61")), "ends too early");
}

TEST(Payload, BoundsTheNesting) {
  const auto nested = [](int levels) {  // the dictionary itself is one
    return wrapped(repeated(levels - 1, "81") + "00");
  };
  EXPECT_EQ(refusal(nested(32)), "");
  EXPECT_EQ(refusal(nested(33)), "nesting deeper than 32");
  EXPECT_EQ(refusal(nested(100000)), "nesting deeper than 32");
  EXPECT_EQ(frameRefusal("81" + nested(32)), "") << "a frame carries every payload";
  EXPECT_EQ(frameRefusal("81" + nested(33)), "nesting deeper than 32");
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
  EXPECT_EQ(text(253402300799), "9999-12-31T23:59:59Z");
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
                        .set("long", std::string(70000, 'x'))
                        .build();
  ASSERT_TRUE(Payload::decode(p.encoded()).has_value());
  EXPECT_EQ(p.size(), 3u);
  EXPECT_EQ(p.find("bad\uFFFDkey")->asInt64(), 1);
  EXPECT_EQ(p.find("list")->text(), "(\uFFFD)");
}

// Whatever way a number's text is found, it is the one that reads back and that is the shortest.
TEST(Value, TextOfDoublesIsTheShortestThatReadsBack) {
  std::mt19937_64 random(7);
  const auto textOf = [](double value) {
    return PayloadBuilder().set("v", value).build().find("v")->text();
  };
  for (int i = 0; i < 300000; ++i) {
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
