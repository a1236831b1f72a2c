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

}  // namespace
