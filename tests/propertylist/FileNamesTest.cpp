#include <gtest/gtest.h>

#include <set>

#include "propertylist/FileNames.h"

namespace vx {
namespace {

TEST(FileNames, EncodesWhatCouldLeadAstrayAndNothingElse) {
  for (const char* text : {"com.example.app", "Music_2-beta.3", "caf\xC3\xA9", "\xE6\xB0\xB4"})
    EXPECT_EQ(encodeFileNameComponent(text), text);
  for (const auto& [text, name] : {std::pair("../../x", "%2E.%2F..%2Fx"),
                                   {"..", "%2E."},
                                   {"100% sure", "100%25%20sure"},
                                   {"a\n\x7F", "a%0A%7F"},
                                   {"\xC2\x85", "%C2%85"},  // a control character of two bytes
                                   {"x\xFF\xC0\xAF", "x%FF%C0%AF"},
                                   {"", "%"}})
    EXPECT_EQ(encodeFileNameComponent(text), name);
}

TEST(FileNames, EveryByteAndPairOfBytesHasItsOwnSafeName) {
  std::set<std::string> names;
  for (int pair = 0; pair < 0x10100; ++pair) {
    std::string text(1, static_cast<char>(pair));
    if (pair > 0xFF) text += static_cast<char>((pair >> 8) - 1);
    const std::string name = encodeFileNameComponent(text);
    EXPECT_EQ(name.find_first_of(std::string_view("/\0", 2)), std::string::npos);
    EXPECT_NE(name[0], '.');
    EXPECT_TRUE(names.insert(name).second) << name;
  }
}

TEST(FileNames, CutsLongNamesAndTellsThemApart) {
  const auto cutAt = [](const std::string& text) {
    return encodeFileNameComponent(text).find("%~");
  };
  const std::string limit(120, 'a'), longest(4095, 'b');
  EXPECT_EQ(encodeFileNameComponent(limit), limit);
  EXPECT_EQ(cutAt(limit + "a"), 102u);
  EXPECT_EQ(encodeFileNameComponent(limit + "a").size(), 120u);
  EXPECT_NE(encodeFileNameComponent(longest + "b"), encodeFileNameComponent(longest + "c"));
  // Three bytes each: the cut must not fall inside a character or an escape.
  EXPECT_EQ(cutAt(std::string(101, 'x') + std::string(60, '/')), 101u);
  std::string water = "x";
  for (int i = 0; i < 60; ++i) water += "\xE6\xB0\xB4";
  EXPECT_EQ(cutAt(water), 100u);
}

}  // namespace
}  // namespace vx
