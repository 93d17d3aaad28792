#include <gtest/gtest.h>

#include <limits>

#include "propertylist/JsonWriter.h"

namespace vx {
namespace {

constexpr double kInfinity = std::numeric_limits<double>::infinity();

std::string compact(const Payload& payload, NonFinite nonFinite = NonFinite::AsText) {
  std::string out;
  appendJson(out, payload, nonFinite);
  return out;
}

std::string asJson(std::string_view text) {
  std::string out;
  appendJsonString(out, text);
  return out;
}

TEST(JsonWriter, WritesEveryKind) {
  const Payload payload = PayloadBuilder()
                              .set("i", -7)
                              .set("u", std::numeric_limits<uint64_t>::max())
                              .set("f", 0.1f)
                              .set("d", 0.1)
                              .set("whole", 100000.0)
                              .set("b", false)
                              .set("s", "\xC3\xBC")
                              .set("t", PayloadDate{1363896240.5})
                              .set("a", ArrayBuilder().add(1).add("x").add(ArrayBuilder()))
                              .set("n", PayloadBuilder().set("k", 1).build())
                              .set("e", Payload())
                              .build();
  EXPECT_EQ(compact(payload),
            R"({"i":-7,"u":18446744073709551615,"f":0.1,"d":0.1,"whole":100000,"b":false,)"
            "\"s\":\"\xC3\xBC\","
            R"("t":"2013-03-21T20:04:00.5Z","a":[1,"x",[]],"n":{"k":1},"e":{}})");
}

TEST(JsonWriter, EscapesWhereverTheCharacterStands) {
  EXPECT_EQ(asJson(std::string_view("\0\x1F\b\f\n\r\t\"\\/\x7F", 11)),
            "\"\\u0000\\u001f\\b\\f\\n\\r\\t\\\"\\\\/\x7F\"");
  for (const auto& [special, escaped] :
       {std::pair('"', "\\\""), {'\\', "\\\\"}, {'\n', "\\n"}, {'\x1F', "\\u001f"}}) {
    for (std::size_t at = 0; at < 20; ++at) {
      std::string text(20, '\x7F');
      text[at] = special;
      EXPECT_EQ(asJson(text.substr(0, at + 1)), '"' + std::string(at, '\x7F') + escaped + '"');
      EXPECT_EQ(asJson(text.substr(at)), '"' + (escaped + std::string(19 - at, '\x7F')) + '"');
    }
  }
  std::string part;
  appendJsonText(part, std::string(5000, '\x10'));
  EXPECT_EQ(asJson(std::string(5000, '\x10')), '"' + part + '"');
  EXPECT_EQ(part.size(), 30000u);
  EXPECT_TRUE(part.ends_with("\\u0010"));
  EXPECT_EQ(asJson("a\xFF"), "\"a\xEF\xBF\xBD\"") << "the file must stay UTF-8";
}

TEST(JsonWriter, TailIsWhatIsMissingBehindTheBeginning) {
  const Payload empty;
  const Payload one = PayloadBuilder().set("a", 1).build();
  const Payload two = PayloadBuilder().set("a", 1).set("b", ArrayBuilder().add("x")).build();
  PayloadBuilder many;
  for (int i = 0; i < 23; ++i) many.set("k" + std::to_string(i), i);
  const Payload full = many.build();  // one more entry makes the head longer
  const Payload fuller = many.set("last", true).build();
  for (const auto& [whole, beginning] : {std::pair(one, empty),
                                         {two, one},
                                         {two, empty},
                                         {two, two},
                                         {empty, empty},
                                         {fuller, full},
                                         {fuller, empty}}) {
    std::string text = compact(beginning);
    text.pop_back();
    EXPECT_TRUE(appendJsonTail(text, whole, beginning));
    EXPECT_EQ(text, compact(whole));
  }
  std::string untouched = "x";
  EXPECT_FALSE(appendJsonTail(untouched, one, two));
  EXPECT_FALSE(appendJsonTail(untouched, two, PayloadBuilder().set("a", 2).build()));
  EXPECT_FALSE(appendJsonTail(untouched, PayloadBuilder().set("a", 2).set("b", 1).build(), one));
  EXPECT_EQ(untouched, "x");
}

TEST(JsonWriter, AppendsToWhatIsThere) {
  std::string out = "[";
  appendJson(out, PayloadBuilder().set("a", 1).build());
  out += ",";
  appendJson(out, *PayloadBuilder().set("a", 2).build().find("a"));
  EXPECT_EQ(out, R"([{"a":1},2)");
}

TEST(JsonWriter, PrettyIndentsAllButTheFirstLine) {
  const Payload payload = PayloadBuilder()
                              .set("a", ArrayBuilder().add(1).add(2))
                              .set("e", Payload())
                              .set("d", PayloadBuilder().set("x", true).build())
                              .build();
  std::string out;
  appendPrettyJson(out, payload, 1);
  const std::string lines =
      "{\n  \"a\": [\n   1,\n   2\n  ],\n  \"e\": {},\n  \"d\": {\n   \"x\": true\n  }\n }";
  EXPECT_EQ(out, lines);
  out.clear();
  appendPrettyJson(out, *PayloadBuilder().set("k", payload).build().find("k"), 1);
  EXPECT_EQ(out, lines);
}

TEST(JsonWriter, NonFiniteNumbersAreTextOrRefusedByName) {
  const Payload inner = PayloadBuilder().set("peak", -kInfinity).build();
  const Payload payload = PayloadBuilder()
                              .set("n", std::numeric_limits<double>::quiet_NaN())
                              .set("l", ArrayBuilder().add(0).add(inner))
                              .build();
  EXPECT_EQ(compact(payload), R"({"n":"NaN","l":[0,{"peak":"-Infinity"}]})");
  EXPECT_EQ(compact(payload, NonFinite::Refuse), R"({"n":null,"l":[0,{"peak":null}]})");
  const auto error = checkJson(PayloadBuilder(payload).set("n", 0.5).build());
  ASSERT_TRUE(error.has_value());
  EXPECT_NE(error->reason.find("l[1].peak"), std::string::npos) << error->reason;
  EXPECT_EQ(checkJson(PayloadBuilder().set("n", 0.5).set("l", "x").build()), std::nullopt);
}

}  // namespace
}  // namespace vx
