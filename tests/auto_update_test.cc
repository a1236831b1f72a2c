// kivoctl auto-update on a system root against a package server on the
// loopback, for packages installed from that server: an upgradable package
// is upgraded and runs again, a beta is
// held back on the stable channel and taken on the beta channel, a failing
// upgrade leaves the old version running and fails the run, the settings
// "off" and the chosen list are honoured, and --dry-run changes nothing; the
// web API reads the switches as the run does. A version whose upgrade failed
// is remembered and not tried again until a newer one is offered; an
// uninstall forgets it, and a damaged record of failures is read as empty.

#include <ctime>

#include <gtest/gtest.h>

#include "pkgtool/registry.h"
#include "settings/web_utils.h"
#include "testing/catalogue_feed.h"
#include "testing/cgi_client.h"
#include "testing/http_test_server.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

class AutoUpdateTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_.Write("/etc/kivo/pkgserver.conf", VendorConf(vendor_.Url()));
    Settings("yes", "yes", "stable");
  }
  void TearDown() override {
    for (const std::string& id : PackageRegistry::List()) Kivoctl({"stop", id});
  }
  // The automatic-update switches and the update channel, as the settings
  // store them; unsigned packages are accepted.
  void Settings(const std::string& enable, const std::string& all, const std::string& channel) {
    root_.Write("/etc/kivoinfo.conf",
                "pkg_source_trust_level=\"1\"\n"
                "enable_pkg_autoupdate_all=\"" +
                    enable + "\"\npkg_autoupdate_all=\"" + all + "\"\npackage_update_channel=\"" +
                    channel + "\"\n");
  }
  // Installs and starts version 1.0 of `id` from the vendor's server:
  // automatic updates come from the origin a package was installed from.
  void InstallOld(const std::string& id) {
    TestPackage v1;
    v1.id = id;
    ASSERT_TRUE(vendor_.Offer(v1));
    std::string out;
    ASSERT_EQ(0, Kivoctl({"install-server", id, "--run"}, &out)) << out;
  }
  // The vendor offers version 2.0 of `id` (with `scripts`), as a beta when
  // `beta`. Call Serve() after the last.
  void Offer(const std::string& id, const std::map<std::string, std::string>& scripts = {},
             bool beta = false, const std::string& version = "2.0") {
    TestPackage v2;
    v2.id = id;
    v2.version = version;
    v2.scripts = scripts;
    vendor_.Replace(v2);
    if (beta) betas_.push_back(id);
  }
  void Serve() {
    ASSERT_TRUE(vendor_.Index());
    for (const std::string& id : betas_) vendor_.Entry(id)["beta"] = true;
    vendor_.Publish();
  }
  int AutoUpdate(std::string* out, bool dry_run = false) {
    std::vector<std::string> args = {"auto-update"};
    if (dry_run) args.push_back("--dry-run");
    return Kivoctl(args, out);
  }
  // "ID VERSION STATE" from kivoctl list.
  std::string State(const std::string& id) {
    std::string out;
    EXPECT_EQ(0, Kivoctl({"list"}, &out)) << out;
    size_t at = out.find(id + " ");
    return at == std::string::npos ? "" : out.substr(at, out.find('\n', at) - at);
  }

  // The record of versions that failed, as the run keeps it (null when
  // there is none or it is not JSON).
  Json::Value Failures() {
    Json::Value failures;
    if (!WebUtils::LoadJsonFile(FailuresPath(), failures)) return Json::Value();
    return failures;
  }
  std::string FailuresPath() {
    return root_.Path("/usr/kivo/etc/packages/autoupdate-failures.json");
  }
  std::string FailuresText() { return FileText(FailuresPath()); }
  // How often the package file of `id` that the vendor now offers was
  // downloaded.
  int Downloads(const std::string& id) {
    const std::string file = vendor_.FilePath(id);
    return server_.Requests("/vendor/" + file.substr(file.rfind('/') + 1));
  }

  TempRoot root_;
  HttpTestServer server_;
  CatalogueFeed vendor_{server_, root_.Path("/vendor-files"), "/vendor"};
  std::vector<std::string> betas_;
};

TEST_F(AutoUpdateTest, UpgradesAnUpgradablePackageWhichRunsAgain) {
  InstallOld("au-a");
  Offer("au-a");
  Serve();
  std::string out;
  ASSERT_EQ(0, AutoUpdate(&out, true)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: would upgrade 1.0 -> 2.0 from http://")) << out;
  EXPECT_EQ("au-a 1.0 running", State("au-a"));

  ASSERT_EQ(0, AutoUpdate(&out)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: upgraded 1.0 -> 2.0")) << out;
  EXPECT_EQ("au-a 2.0 running", State("au-a"));

  // Nothing newer is left.
  ASSERT_EQ(0, AutoUpdate(&out)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: skipped: no newer version offered")) << out;
}

TEST_F(AutoUpdateTest, BetaOnlyOnTheBetaChannel) {
  InstallOld("au-a");
  Offer("au-a", {}, true);
  Serve();
  std::string out;
  ASSERT_EQ(0, AutoUpdate(&out)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: skipped: only a beta version is newer")) << out;
  EXPECT_EQ("au-a 1.0 running", State("au-a"));

  Settings("yes", "yes", "beta");
  ASSERT_EQ(0, AutoUpdate(&out)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: upgraded 1.0 -> 2.0")) << out;
  EXPECT_EQ("au-a 2.0 running", State("au-a"));
}

TEST_F(AutoUpdateTest, FailedUpgradeLeavesTheOldVersionRunning) {
  InstallOld("au-a");
  InstallOld("au-b");
  Offer("au-a", {{"postupgrade", "echo postupgrade refuses >&2\nexit 1\n"}});
  Offer("au-b");
  Serve();
  std::string out;
  EXPECT_EQ(1, AutoUpdate(&out)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: failed 1.0 -> 2.0: ")) << out;
  EXPECT_NE(std::string::npos, out.find("[305]")) << out;
  EXPECT_EQ("au-a 1.0 running", State("au-a"));
  // One failure does not stop the others.
  EXPECT_NE(std::string::npos, out.find("au-b: upgraded 1.0 -> 2.0")) << out;
  EXPECT_EQ("au-b 2.0 running", State("au-b"));
}

TEST_F(AutoUpdateTest, AFailedVersionWaitsForANewerOne) {
  InstallOld("au-a");
  Offer("au-a", {{"postupgrade", "echo postupgrade refuses >&2\nexit 1\n"}});
  Serve();
  std::string out;
  const long long before = time(nullptr);
  EXPECT_EQ(1, AutoUpdate(&out)) << out;
  const long long after = time(nullptr);
  EXPECT_NE(std::string::npos, out.find("au-a: failed 1.0 -> 2.0: ")) << out;
  EXPECT_EQ("au-a 1.0 running", State("au-a"));
  const Json::Value failed = Failures()["au-a"];
  ASSERT_TRUE(failed.isObject()) << FailuresText();
  EXPECT_EQ("2.0", failed["version"].asString());
  EXPECT_EQ(305, failed["code"].asInt());
  ASSERT_TRUE(failed["time"].isInt64());
  EXPECT_LE(before, failed["time"].asInt64());
  EXPECT_GE(after, failed["time"].asInt64());
  const std::string reason = failed["reason"].asString();
  EXPECT_NE(std::string::npos, reason.find("postupgrade")) << reason;
  EXPECT_EQ(std::string::npos, reason.find('\n')) << reason;

  // The next run does not download it again and says why, in words; a dry
  // run says the same and writes nothing.
  const time_t failed_at = static_cast<time_t>(failed["time"].asInt64());
  char when[32];
  strftime(when, sizeof(when), "%Y-%m-%d %H:%M UTC", gmtime(&failed_at));
  const std::string skipped = "au-a: skipped: 2.0 failed on " + std::string(when) +
                              " and was restored (" + reason + "); waiting for a newer version\n";
  const std::string recorded = FailuresText();
  const int downloads = Downloads("au-a");
  for (bool dry_run : {true, false}) {
    ASSERT_EQ(0, AutoUpdate(&out, dry_run)) << out;
    EXPECT_NE(std::string::npos, out.find(skipped)) << out;
    EXPECT_EQ("au-a 1.0 running", State("au-a"));
    EXPECT_EQ(recorded, FailuresText());
  }
  EXPECT_EQ(downloads, Downloads("au-a"));

  // A fixed version is taken, and the failure is forgotten.
  Offer("au-a", {}, false, "3.0");
  Serve();
  ASSERT_EQ(0, AutoUpdate(&out, true)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: would upgrade 1.0 -> 3.0")) << out;
  ASSERT_EQ(0, AutoUpdate(&out)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: upgraded 1.0 -> 3.0")) << out;
  EXPECT_EQ("au-a 3.0 running", State("au-a"));
  EXPECT_TRUE(Failures().isObject()) << FailuresText();
  EXPECT_FALSE(Failures().isMember("au-a")) << FailuresText();
}

TEST_F(AutoUpdateTest, AnUninstallForgetsTheFailedVersion) {
  InstallOld("au-a");
  Offer("au-a", {{"postupgrade", "exit 1\n"}});
  Serve();
  std::string out;
  EXPECT_EQ(1, AutoUpdate(&out)) << out;
  ASSERT_TRUE(Failures().isMember("au-a")) << out << FailuresText();

  ASSERT_EQ(0, Kivoctl({"uninstall", "au-a"}, &out)) << out;
  ASSERT_EQ(0, AutoUpdate(&out)) << out;
  EXPECT_TRUE(Failures().isObject()) << FailuresText();
  EXPECT_FALSE(Failures().isMember("au-a")) << FailuresText();

  // Installed again, the same version is tried again.
  Offer("au-a", {}, false, "1.0");
  Serve();
  ASSERT_EQ(0, Kivoctl({"install-server", "au-a", "--run"}, &out)) << out;
  Offer("au-a", {{"postupgrade", "exit 1\n"}});
  Serve();
  EXPECT_EQ(1, AutoUpdate(&out)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: failed 1.0 -> 2.0: ")) << out;
}

// The record is checked whole: one entry that is not valid makes the whole
// file count as empty (a dry run reads it so and leaves it), and a run
// replaces it.
TEST_F(AutoUpdateTest, ADamagedRecordOfFailuresIsReadAsEmptyAndReplaced) {
  InstallOld("au-a");
  Offer("au-a");
  Serve();
  // An entry that holds for the installed 1.0: 2.0 failed over this record.
  const std::string entry = R"({"code": 305, "reason": "failed in postupgrade", "record": ")" +
                            PackageRegistry::PublishedRecord("au-a") +
                            R"(", "time": 1700000000, "version": "2.0"})";
  std::string out;
  root_.Write("/usr/kivo/etc/packages/autoupdate-failures.json", "{\"au-a\": " + entry + "}");
  ASSERT_EQ(0, AutoUpdate(&out, true)) << out;
  EXPECT_NE(std::string::npos,
            out.find("au-a: skipped: 2.0 failed on 2023-11-14 22:13 UTC and was restored (failed "
                     "in postupgrade); waiting for a newer version"))
      << out;

  for (const std::string& damaged :
       {std::string("not json"), std::string("[]"),
        "{\"au-a\": " + entry + ", \"../x\": " + entry + "}",
        "{\"au-a\": " + entry + ", \"au-b\": {\"version\": \"2.0;rm\"}}",
        "{\"au-a\": " + entry.substr(0, entry.size() - 1) + ", \"more\": 1}}"}) {
    root_.Write("/usr/kivo/etc/packages/autoupdate-failures.json", damaged);
    ASSERT_EQ(0, AutoUpdate(&out, true)) << out;
    EXPECT_NE(std::string::npos, out.find("au-a: would upgrade 1.0 -> 2.0")) << damaged << out;
    EXPECT_EQ(damaged, FailuresText());
  }
  ASSERT_EQ(0, AutoUpdate(&out)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: upgraded 1.0 -> 2.0")) << out;
  EXPECT_EQ(Json::Value(Json::objectValue), Failures()) << FailuresText();
}

TEST_F(AutoUpdateTest, OffChosenListAndRestrictions) {
  InstallOld("au-a");
  InstallOld("au-b");
  InstallOld("au-c");
  Offer("au-a");
  Offer("au-b");
  Offer("au-c");
  Serve();
  std::string out;
  Settings("no", "yes", "stable");
  const int asked = server_.Requests("/vendor/catalogue.json");
  ASSERT_EQ(0, AutoUpdate(&out)) << out;
  EXPECT_EQ("automatic update is off\n", out);
  EXPECT_EQ(asked, server_.Requests("/vendor/catalogue.json"));

  Settings("yes", "no", "stable");
  root_.Write("/usr/kivo/etc/packages/autoupdate.json", "[\"au-b\", \"au-c\"]");
  root_.Write("/usr/kivo/etc/packages/restricted", "au-c 2.0\n");
  ASSERT_EQ(0, AutoUpdate(&out, true)) << out;
  EXPECT_EQ("au-b 1.0 running", State("au-b"));
  ASSERT_EQ(0, AutoUpdate(&out)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: skipped: not chosen for automatic update")) << out;
  EXPECT_NE(std::string::npos, out.find("au-b: upgraded 1.0 -> 2.0")) << out;
  EXPECT_NE(std::string::npos, out.find("au-c: skipped: no newer version offered")) << out;
  EXPECT_EQ("au-a 1.0 running", State("au-a"));
  EXPECT_EQ("au-b 2.0 running", State("au-b"));
  EXPECT_EQ("au-c 1.0 running", State("au-c"));
}

// Without "pkg_autoupdate_all" the switches mean the same to every reader:
// the run, the settings, the list's flag and one package's "delete" all take
// automatic update to cover every package.
TEST_F(AutoUpdateTest, AnAbsentAllSwitchMeansEveryPackageToEveryReader) {
  InstallOld("au-a");
  InstallOld("au-b");
  Offer("au-a");
  Offer("au-b");
  Serve();
  root_.Write("/etc/kivoinfo.conf",
              "pkg_source_trust_level=\"1\"\nenable_pkg_autoupdate_all=\"yes\"\n"
              "package_update_channel=\"stable\"\n");
  root_.Write("/usr/kivo/etc/packages/autoupdate.json", "[\"au-a\"]");
  std::string out;
  ASSERT_EQ(0, AutoUpdate(&out, true)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: would upgrade")) << out;
  EXPECT_NE(std::string::npos, out.find("au-b: would upgrade")) << out;

  root_.AddAccount("admin", "secret", {"administrators"});
  ApiClient client("admin", "secret");
  ASSERT_TRUE(client.signed_in());
  CgiAnswer settings = client.Call("KIVO.Core.Package.Setting", "get", 1);
  ASSERT_TRUE(settings.Success()) << settings.body;
  EXPECT_TRUE(settings.Data()["enable_autoupdate"].asBool());
  EXPECT_TRUE(settings.Data()["autoupdateall"].asBool());
  CgiAnswer list =
      client.Call("KIVO.Core.Package", "list", 1, {{"additional", "[\"autoupdate\"]"}});
  ASSERT_TRUE(list.Success()) << list.body;
  ASSERT_EQ(2u, list.Data()["packages"].size()) << list.body;
  for (const Json::Value& p : list.Data()["packages"]) {
    EXPECT_TRUE(p["additional"]["autoupdate"].asBool()) << p["id"].asString();
  }
  // Leaving one package out makes a chosen list of all the others.
  ASSERT_TRUE(
      client.Call("KIVO.Core.Package.Setting.Update", "delete", 1, {{"id", "au-a"}}).Success());
  Json::Value chosen;
  ASSERT_TRUE(WebUtils::LoadJsonFile(root_.Path("/usr/kivo/etc/packages/autoupdate.json"), chosen));
  ASSERT_EQ(1u, chosen.size()) << chosen.toStyledString();
  EXPECT_EQ("au-b", chosen[0].asString());
}

}  // namespace
