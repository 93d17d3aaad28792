#include <gtest/gtest.h>

#include <limits>

#include "propertylist/JsonWriter.h"
#include "tests/propertylist/Dictionary.h"

namespace vx {
namespace {

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
  const Payload payload = dictionary(
      "i", -7, "u", std::numeric_limits<uint64_t>::max(), "f", 0.1f, "d", 0.1, "whole", 100000.0,
      "b", false, "s", "\xC3\xBC", "t", PayloadDate{1363896240.5}, "a",
      ArrayBuilder().add(1).add("x").add(ArrayBuilder()), "n", dictionary("k", 1), "e", Payload());
  const std::string json =
      R"({"i":-7,"u":18446744073709551615,"f":0.1,"d":0.1,"whole":100000.0,"b":false,)"
      "\"s\":\"\xC3\xBC\","
      R"("t":"2013-03-21T20:04:00.5Z","a":[1,"x",[]],"n":{"k":1},"e":{}})";
  EXPECT_EQ(compact(payload), json);
  std::string out = "[";
  appendJson(out, payload);
  appendJson(out += ",", *payload.find("i"));
  EXPECT_EQ(out, "[" + json + ",-7");
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

TEST(JsonWriter, TailIsWhatIsMissingAfterTheBeginning) {
  const Payload empty, one = dictionary("a", 1);
  const Payload two = dictionary("a", 1, "b", ArrayBuilder().add("x"));
  PayloadBuilder many;
  for (int i = 0; i < 23; ++i) many.set("k" + std::to_string(i), i);
  const Payload full = many.build();  // one more entry makes the head longer
  const Payload fuller = many.set("last", true).build();
  for (const auto& [whole, beginning] :
       {std::pair(two, one), {two, empty}, {two, two}, {empty, empty}, {fuller, full}}) {
    std::string text = compact(beginning);
    text.pop_back();
    EXPECT_TRUE(appendJsonTail(text, whole, beginning));
    EXPECT_EQ(text, compact(whole));
  }
  std::string untouched = "x";
  EXPECT_FALSE(appendJsonTail(untouched, one, two));
  EXPECT_FALSE(appendJsonTail(untouched, two, dictionary("a", 2)));
  EXPECT_FALSE(appendJsonTail(untouched, dictionary("a", 2, "b", 1), one));
  EXPECT_EQ(untouched, "x");
}

TEST(JsonWriter, PrettyIndentsAllButTheFirstLine) {
  const Payload payload =
      dictionary("a", ArrayBuilder().add(1).add(2), "e", Payload(), "d", dictionary("x", true));
  const std::string lines =
      "{\n  \"a\": [\n   1,\n   2\n  ],\n  \"e\": {},\n  \"d\": {\n   \"x\": true\n  }\n }";
  std::string out, nested;
  appendPrettyJson(out, payload, 1);
  EXPECT_EQ(out, lines);
  appendPrettyJson(nested, *dictionary("k", payload).find("k"), 1);
  EXPECT_EQ(nested, lines);
}

TEST(JsonWriter, NonFiniteNumbersAreTextOrRefusedByName) {
  const Payload inner = dictionary("peak", -std::numeric_limits<double>::infinity());
  const Payload payload = dictionary("n", std::numeric_limits<double>::quiet_NaN(), "l",
                                     ArrayBuilder().add(0).add(inner));
  EXPECT_EQ(compact(payload), R"({"n":"NaN","l":[0,{"peak":"-Infinity"}]})");
  EXPECT_EQ(compact(payload, NonFinite::Refuse), R"({"n":null,"l":[0,{"peak":null}]})");
  const auto error = checkJson(PayloadBuilder(payload).set("n", 0.5).build());
  ASSERT_TRUE(error.has_value());
  EXPECT_NE(error->reason.find("l[1].peak"), std::string::npos) << error->reason;
  EXPECT_EQ(checkJson(dictionary("n", 0.5, "l", "x")), std::nullopt);
}

}  // namespace
}  // namespace vx
