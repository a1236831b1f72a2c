#include "pkgtool/registry.h"

#include <gtest/gtest.h>

namespace {

TEST(RegistryTest, PackageIds) {
  for (const std::string& good : {std::string("a"), std::string("Demo-Web_1.2+x"),
                                  std::string("9lives"), std::string(64, 'x')}) {
    EXPECT_TRUE(PMSIsValidPackageId(good)) << good;
  }
  for (const char* bad : {"", ".", "..", "../etc", "a/b", "-a", ".hidden", "a b", "a\nb", "é"}) {
    EXPECT_FALSE(PMSIsValidPackageId(bad)) << bad;
  }
  EXPECT_FALSE(PMSIsValidPackageId(std::string(65, 'x')));
}

TEST(RegistryTest, ContainedRelativePaths) {
  for (const char* good : {"log", "var/app.log", "a/b/c"}) {
    EXPECT_TRUE(PMSIsContainedRelativePath(good)) << good;
  }
  for (const char* bad : {"", "/etc/passwd", "../x", "a/../../x", "a//b", "./a", "a/", "a/."}) {
    EXPECT_FALSE(PMSIsContainedRelativePath(bad)) << bad;
  }
}

TEST(RegistryTest, StrictlyInside) {
  EXPECT_TRUE(PMSIsStrictlyInside("/r/var/packages/.records/a.1", "/r/var/packages/.records"));
  EXPECT_TRUE(PMSIsStrictlyInside("/v/@appstore/a/b", "/v/@appstore"));
  for (const char* path :
       {"", "/r/var/packages/.records", "/r/var/packages/.records/", "/r/var/packages",
        "/r/var/packages/.recordsX", "/r/var/packages/.records/..", "/r/var/packages/.records/../x",
        "/r/var/packages/.records//a"}) {
    EXPECT_FALSE(PMSIsStrictlyInside(path, "/r/var/packages/.records")) << path;
  }
  // An owner that is empty, relative or ends in a slash owns nothing.
  EXPECT_FALSE(PMSIsStrictlyInside("/a", ""));
  EXPECT_FALSE(PMSIsStrictlyInside("x/a", "x"));
  EXPECT_FALSE(PMSIsStrictlyInside("/a", "/"));
}

TEST(RegistryTest, RecordNames) {
  EXPECT_TRUE(PackageRegistry::IsRecordNameOf("app", ".records/app.0a1b"));
  for (const char* bad : {"", ".records/", ".records/app.", ".records/app", ".records/other.1",
                          ".records/app.1/x", ".records/app./..", "app.1", "../app.1"}) {
    EXPECT_FALSE(PackageRegistry::IsRecordNameOf("app", bad)) << bad;
  }
  EXPECT_FALSE(PackageRegistry::IsRecordNameOf("", ".records/.1"));
}

}  // namespace
