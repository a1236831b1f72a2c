#include "webapi/url_encoded.h"

#include <gtest/gtest.h>

namespace {

TEST(UrlEncodedTest, SplitsAndDecodesInOrder) {
  FormFields f;
  std::string error;
  ASSERT_TRUE(ParseUrlEncoded("a=1&b=%22x+y%22&&flag&c=", &f, &error));
  ASSERT_EQ(4u, f.size());
  EXPECT_EQ("a", f[0].first);
  EXPECT_EQ("\"x y\"", f[1].second);
  EXPECT_EQ("flag", f[2].first);
  EXPECT_EQ("", f[2].second);
  EXPECT_EQ("c", f[3].first);
}

TEST(UrlEncodedTest, RefusesBrokenEscapes) {
  for (const char* bad : {"a=%", "a=%2", "a=%zz", "%g1=x", "a=1&b=%4"}) {
    FormFields f;
    std::string error;
    EXPECT_FALSE(ParseUrlEncoded(bad, &f, &error)) << bad;
    EXPECT_NE("", error);
  }
}

TEST(UrlEncodedTest, KeepsArbitraryBytesButNul) {
  FormFields f;
  std::string error;
  ASSERT_TRUE(ParseUrlEncoded("n=%FF%01%C3", &f, &error));
  EXPECT_EQ(std::string("\xFF\x01\xC3", 3), f[0].second);
  // A NUL would cut the value short wherever it becomes a C string.
  for (const std::string& bad :
       {std::string("id=demo%00/../x"), std::string("n%00=1"), std::string("a=1&id=x\0y", 11)}) {
    FormFields g;
    EXPECT_FALSE(ParseUrlEncoded(bad, &g, &error)) << bad;
    EXPECT_NE(std::string::npos, error.find("NUL")) << error;
  }
}

}  // namespace
