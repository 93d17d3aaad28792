#include <gtest/gtest.h>

#include <set>

#include "propertylist/FileNames.h"

namespace vx {
namespace {

TEST(FileNames, LeavesOrdinaryIdentifiersAlone) {
  for (const char* text : {"com.example.app", "Music_2-beta.3", "caf\xC3\xA9", "\xE6\xB0\xB4"})
    EXPECT_EQ(encodeFileNameComponent(text), text);
}

TEST(FileNames, EncodesWhatCouldLeadAstray) {
  EXPECT_EQ(encodeFileNameComponent("../../x"), "%2E.%2F..%2Fx");
  EXPECT_EQ(encodeFileNameComponent(".."), "%2E.");
  EXPECT_EQ(encodeFileNameComponent("a/b"), "a%2Fb");
  EXPECT_EQ(encodeFileNameComponent("100% sure"), "100%25%20sure");
  EXPECT_EQ(encodeFileNameComponent(std::string_view("a\0\n\x7F", 4)), "a%00%0A%7F");
  EXPECT_EQ(encodeFileNameComponent("\xC2\x85"), "%C2%85") << "a control character of two bytes";
  EXPECT_EQ(encodeFileNameComponent("x\xFF\xC0\xAF"), "x%FF%C0%AF") << "not UTF-8";
  EXPECT_EQ(encodeFileNameComponent(""), "%");
}

TEST(FileNames, EveryByteAndPairOfBytesHasItsOwnSafeName) {
  std::set<std::string> names;
  std::size_t texts = 0;
  for (int first = 0; first < 256; ++first) {
    for (int second = -1; second < 256; ++second, ++texts) {
      std::string text(1, static_cast<char>(first));
      if (second >= 0) text += static_cast<char>(second);
      const std::string name = encodeFileNameComponent(text);
      EXPECT_EQ(name.find('/'), std::string::npos);
      EXPECT_NE(name[0], '.');
      names.insert(name);
    }
  }
  EXPECT_EQ(names.size(), texts);
}

TEST(FileNames, CutsLongNamesAndTellsThemApart) {
  EXPECT_EQ(encodeFileNameComponent(std::string(120, 'a')), std::string(120, 'a'));
  const std::string cut = encodeFileNameComponent(std::string(121, 'a'));
  EXPECT_EQ(cut.substr(0, 104), std::string(102, 'a') + "%~");
  EXPECT_EQ(cut.size(), 120u);
  std::string one(4096, 'b');
  std::string other = one;
  other.back() = 'c';
  EXPECT_NE(encodeFileNameComponent(one), encodeFileNameComponent(other));
  // Three bytes each: the cut must not fall inside a character or an escape.
  EXPECT_EQ(encodeFileNameComponent(std::string(101, 'x') + std::string(60, '/')).find("%~"), 101u);
  std::string water = "x";
  for (int i = 0; i < 60; ++i) water += "\xE6\xB0\xB4";
  EXPECT_EQ(encodeFileNameComponent(water).find("%~"), 100u);
}

}  // namespace
}  // namespace vx
