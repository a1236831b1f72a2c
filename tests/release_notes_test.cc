// Release notes (the CHANGELOG member): `kivoctl build` carries them into the
// package file, `kivoctl index` into the catalogue entry, and the upload's
// answer through the real host hands them to the page; notes that break the
// rules (control characters, not UTF-8, too large) fail the build, and a
// hand-made file that holds such notes is refused.

#include <gtest/gtest.h>
#include <json/value.h>

#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "pkgtool/package_builder.h"
#include "testing/admin_api_test.h"
#include "testing/cgi_client.h"
#include "testing/package_factory.h"

namespace {

constexpr char kInstallation[] = "KIVO.Core.Package.Installation";
constexpr char kNotes[] =
    "1.1\n"
    "\t- Faster start.\n"
    "\t- <b>Not markup</b> & never shown as such.\r\n"
    "- Grüße: UTF-8 is kept.\n";

class ReleaseNotesTest : public AdminApiTest {
 protected:
  void SetUp() override { Trust(1); }

  // A package source folder `name` whose CHANGELOG is `notes`.
  std::string Source(const std::string& name, const std::string& notes) {
    const std::string src = root_.Path("/src/" + name);
    root_.Write("/src/" + name + "/INFO", "package=\"noted-app\"\nversion=\"1.1\"\n");
    root_.Write("/src/" + name + "/package/file.txt", "payload\n");
    root_.Write("/src/" + name + "/CHANGELOG", notes);
    return src;
  }
};

TEST_F(ReleaseNotesTest, BuildAndIndexCarryThemAndTheUploadAnswersThem) {
  std::string out;
  const std::string file = root_.Path("/feed/noted-app-1.1.kpk");
  ASSERT_EQ(0, KIVOFSMkdirP(root_.Path("/feed").c_str()));
  ASSERT_EQ(0, Kivoctl({"build", Source("good", kNotes), file}, &out)) << out;
  ASSERT_EQ(0,
            Kivoctl({"index", root_.Path("/feed"), "--base-url", "http://127.0.0.1:9/feed"}, &out))
      << out;
  std::string text;
  Json::Value catalogue;
  ASSERT_TRUE(KIVOReadFile(root_.Path("/feed/catalogue.json"), &text));
  ASSERT_TRUE(KIVOParseJson(text, &catalogue)) << text;
  ASSERT_EQ(1u, catalogue["packages"].size()) << text;
  EXPECT_EQ(kNotes, catalogue["packages"][0]["changelog"].asString());

  CgiAnswer up = client().Upload(kInstallation, "upload", 1, {}, file);
  ASSERT_TRUE(up.Success()) << up.body;
  EXPECT_EQ(kNotes, up.Data()["changelog"].asString()) << up.body;
}

TEST_F(ReleaseNotesTest, APackageWithoutNotesHasNone) {
  const std::string file = TestPackage().Build(root_.Path("/plain"));
  std::string out;
  ASSERT_EQ(0, Kivoctl({"index", root_.Path("/plain"), "--base-url", "http://127.0.0.1:9/p"}, &out))
      << out;
  std::string text;
  Json::Value catalogue;
  ASSERT_TRUE(KIVOReadFile(root_.Path("/plain/catalogue.json"), &text));
  ASSERT_TRUE(KIVOParseJson(text, &catalogue)) << text;
  EXPECT_FALSE(catalogue["packages"][0].isMember("changelog")) << text;
  CgiAnswer up = client().Upload(kInstallation, "upload", 1, {}, file);
  ASSERT_TRUE(up.Success()) << up.body;
  EXPECT_FALSE(up.Data().isMember("changelog")) << up.body;
}

TEST_F(ReleaseNotesTest, NotesThatBreakTheRulesFailTheBuild) {
  const std::pair<const char*, std::string> kBad[] = {
      {"control", std::string("ok\n\x1b[31mred\n")},
      {"bare-cr", std::string("one\rtwo\n")},
      {"latin1", std::string("Gr\xfc\xdf"
                             "e\n")},
      {"overlong", std::string("\xc0\xaf\n")},
      {"large", std::string(16 * 1024 + 1, 'x')},
  };
  for (const auto& [name, notes] : kBad) {
    const std::string file = root_.Path(std::string("/bad-") + name + ".kpk");
    std::string out;
    EXPECT_NE(0, Kivoctl({"build", Source(name, notes), file}, &out)) << name;
    EXPECT_NE(std::string::npos, out.find("CHANGELOG")) << name << ": " << out;
    EXPECT_FALSE(KLIBCFileExist(file.c_str())) << name;
  }
  // Exactly the limit is fine.
  std::string out;
  EXPECT_EQ(
      0, Kivoctl({"build", Source("limit", std::string(16 * 1024, 'x')), root_.Path("/limit.kpk")},
                 &out))
      << out;
}

TEST_F(ReleaseNotesTest, AHandMadeFileWithBadNotesIsRefused) {
  const std::string payload = root_.Path("/raw/package.tgz");
  ASSERT_EQ(0, KIVOFSMkdirP(root_.Path("/raw").c_str()));
  WriteRawPayload(payload, {{"file.txt", 'f', 0644, ""}});
  std::string error;
  const std::string file = root_.Path("/raw/noted.kpk");
  ASSERT_TRUE(
      PMSWritePackage({{"INFO", "package=\"noted-app\"\nversion=\"1.1\"\nextractsize=\"8\"\n"},
                       {"CHANGELOG", "fine\n\x07 bell\n"}},
                      payload, "", file, &error))
      << error;
  std::string out;
  EXPECT_NE(0, Kivoctl({"inspect", file}, &out)) << out;
  EXPECT_NE(std::string::npos, out.find("CHANGELOG holds a control character at byte 5 [261]"))
      << out;
  CgiAnswer up = client().Upload(kInstallation, "upload", 1, {}, file);
  EXPECT_FALSE(up.Success()) << up.body;
}

}  // namespace
