#include "pkgtool/version.h"

#include <gtest/gtest.h>

#include "pkgtool/dependency.h"

namespace {

TEST(VersionTest, ComparesPartByPart) {
  EXPECT_LT(PMSCompareVersion("1.2.3-0045", "1.2.3-0046"), 0);
  EXPECT_LT(PMSCompareVersion("1.2.3-0099", "1.2.4-0001"), 0);
  EXPECT_LT(PMSCompareVersion("1.9", "1.10"), 0);           // numbers, not text
  EXPECT_EQ(PMSCompareVersion("1.2", "1.2.0"), 0);          // missing parts are 0
  EXPECT_EQ(PMSCompareVersion("1.02", "1.2"), 0);           // leading zeros do not count
  EXPECT_GT(PMSCompareVersion("1.2-0001", "1.2"), 0);       // a build number counts
  EXPECT_LT(PMSCompareVersion("3.0.0-beta1", "3.0.0"), 0);  // pre-releases come first
  EXPECT_LT(PMSCompareVersion("3.0.0-beta1", "3.0.0-beta2"), 0);
  EXPECT_GT(PMSCompareVersion("2.0", "1.99999999999999999999999"), 0);  // no overflow
  EXPECT_EQ(PMSCompareVersion("", ""), 0);
}

TEST(VersionTest, OperatorsAndValidity) {
  PackageBasicInfo installed("demo", "1.0-0002"), server("demo", "1.0-0010");
  EXPECT_TRUE(installed.compare(server, PKG_VER_LT));  // "the installed one is lower"
  EXPECT_FALSE(server.compare(installed, PKG_VER_LT));
  EXPECT_TRUE(installed.compare(installed, PKG_VER_GE));
  EXPECT_TRUE(PMSIsValidVersion("1.2.3-0045"));
  for (const std::string& bad : {std::string(), std::string("beta"), std::string("1 2"),
                                 std::string("1;rm"), std::string(33, '1')}) {
    EXPECT_FALSE(PMSIsValidVersion(bad)) << bad;
  }
}

TEST(DependencyTest, TextAndJsonForms) {
  DepPkgVector deps;
  ASSERT_EQ(3, PMSExplodeDepPKGString("demo-web>=1.0: demo-lib :old<2", deps));
  EXPECT_EQ("demo-web", deps[0].getName());
  EXPECT_TRUE(deps[0].accepts("1.0"));
  EXPECT_FALSE(deps[0].accepts("0.9"));
  EXPECT_TRUE(deps[1].accepts("anything1"));
  EXPECT_EQ("demo-web>=1.0:demo-lib:old<2", deps.toString());

  Json::Value json;
  deps.toJSON(json);
  EXPECT_EQ(">=", json["demo-web"]["operator"].asString());
  EXPECT_TRUE(json["demo-lib"].isObject());
  DepPkgVector back;
  ASSERT_EQ(3, PMSParseDepJSON(json, back));
  EXPECT_EQ(2, PMSParseDepJSONString("\"a>1:b\"", back));
  EXPECT_EQ(0, PMSParseDepJSONString("", back));
  EXPECT_EQ(0, PMSParseDepJSONString("{broken", back));
  // Malformed entries are dropped, the rest kept.
  EXPECT_EQ(1, PMSExplodeDepPKGString("../etc:good>>1:ok", deps));
}

TEST(DependencyTest, Services) {
  EXPECT_EQ((std::set<std::string>{"pgsql", "web"}), PMSServiceSet("pgsql:web pgsql, ../x"));
  EXPECT_EQ(0x1u | 0x2u, PMSServiceMask("web:pgsql:unknown"));
  EXPECT_EQ(0u, PMSServiceMask(""));
}

}  // namespace
