// kivoctl auto-update on a system root against a package server on the
// loopback, for packages installed from that server: an upgradable package
// is upgraded and runs again, a beta is
// held back on the stable channel and taken on the beta channel, a failing
// upgrade leaves the old version running and fails the run, the settings
// "off" and the chosen list are honoured, and --dry-run changes nothing; the
// web API reads the switches as the run does. A version whose upgrade failed
// is remembered and not tried again until a newer one is offered; an
// uninstall forgets it, and a damaged record of failures is read as empty.
// The maintenance window, the holds and the random delay: outside the window
// a run does nothing, inside it upgrades all but a held package (once per
// opening, each upgrade on record in the activity log, each outcome in the
// record of the last run); a hold until a day that has begun no longer
// holds; a window or holds that fail a check stop the run whole; the delay
// ends before the window does. The web API sets the window and the holds
// through the real host, refusing bad values whole.

#include <ctime>
#include <unistd.h>

#include <gtest/gtest.h>

#include "pkgserver/update_window.h"
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
  int AutoUpdate(std::string* out, bool dry_run = false,
                 const std::vector<std::string>& more = {}) {
    std::vector<std::string> args = {"auto-update"};
    if (dry_run) args.push_back("--dry-run");
    args.insert(args.end(), more.begin(), more.end());
    return Kivoctl(args, out);
  }
  // A run as at local time `now` ("YYYY-MM-DDTHH:MM").
  int AutoUpdateAt(const std::string& now, std::string* out, bool dry_run = false,
                   const std::vector<std::string>& more = {}) {
    std::vector<std::string> args = {"--now", now};
    args.insert(args.end(), more.begin(), more.end());
    return AutoUpdate(out, dry_run, args);
  }
  // The maintenance window, as the root's configuration holds it.
  void Window(const std::string& text) { root_.Write("/etc/kivo/autoupdate.conf", text); }
  void Holds(const std::string& json) {
    root_.Write("/usr/kivo/etc/packages/autoupdate-holds.json", json);
  }
  // The record of the last run (null when there is none).
  Json::Value LastRun() {
    Json::Value run;
    if (!WebUtils::LoadJsonFile(root_.Path("/usr/kivo/etc/packages/autoupdate-last-run.json"), run))
      return Json::Value();
    return run;
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

// Seconds since the epoch of local time "YYYY-MM-DDTHH:MM", read as
// kivoctl's --now reads it.
long long LocalEpoch(const std::string& text) {
  int64_t when = 0;
  EXPECT_TRUE(KIVOPackageServer::ParseLocalTime(text, &when)) << text;
  return static_cast<long long>(when);
}

constexpr char kMondayWindow[] =
    "window_days=\"mon\"\nwindow_start=\"02:00\"\nwindow_end=\"05:00\"\n"
    "random_delay_minutes=\"0\"\n";

// 2024-05-06 is a Monday.
TEST_F(AutoUpdateTest, OutsideTheWindowNothingInsideAllButTheHeldPackage) {
  InstallOld("au-a");
  InstallOld("au-b");
  InstallOld("au-c");
  Offer("au-a");
  Offer("au-b");
  Offer("au-c");
  Serve();
  Window(kMondayWindow);
  Holds(R"({"au-b": {"until": null, "since": 1714960800, "by": "admin"}})");
  std::string out;
  const int asked = server_.Requests("/vendor/catalogue.json");
  for (bool dry_run : {true, false}) {
    ASSERT_EQ(0, AutoUpdateAt("2024-05-07T03:00", &out, dry_run)) << out;
    EXPECT_NE(std::string::npos, out.find("outside the maintenance window (mon 02:00-05:00); it "
                                          "opens next at 2024-05-13 02:00\n"))
        << out;
    EXPECT_NE(std::string::npos, out.find("au-a: skipped: outside the maintenance window")) << out;
    EXPECT_NE(std::string::npos, out.find("au-b: skipped: held until lifted")) << out;
    EXPECT_NE(std::string::npos, out.find("au-c: skipped: outside the maintenance window")) << out;
  }
  EXPECT_EQ(asked, server_.Requests("/vendor/catalogue.json"));
  EXPECT_EQ("au-a 1.0 running", State("au-a"));
  EXPECT_TRUE(LastRun().isNull());

  ASSERT_EQ(0, AutoUpdateAt("2024-05-06T03:00", &out)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: upgraded 1.0 -> 2.0")) << out;
  EXPECT_NE(std::string::npos, out.find("au-b: skipped: held until lifted")) << out;
  EXPECT_NE(std::string::npos, out.find("au-c: upgraded 1.0 -> 2.0")) << out;
  EXPECT_EQ("au-a 2.0 running", State("au-a"));
  EXPECT_EQ("au-b 1.0 running", State("au-b"));
  EXPECT_EQ("au-c 2.0 running", State("au-c"));

  // Each package's outcome is on record, with the run's time by its clock.
  const Json::Value run = LastRun();
  ASSERT_TRUE(run.isObject()) << out;
  EXPECT_EQ(LocalEpoch("2024-05-06T03:00"), run["started"].asInt64());
  EXPECT_EQ(0, run["exit_status"].asInt());
  EXPECT_EQ("upgraded", run["packages"]["au-a"]["outcome"].asString());
  EXPECT_EQ("1.0", run["packages"]["au-a"]["from"].asString());
  EXPECT_EQ("2.0", run["packages"]["au-a"]["to"].asString());
  EXPECT_EQ("held", run["packages"]["au-b"]["outcome"].asString());
  EXPECT_EQ("skipped: held until lifted", run["packages"]["au-b"]["words"].asString());

  // Each upgrade is an entry of its own in the activity log.
  root_.AddAccount("admin", "secret", {"administrators"});
  ApiClient client("admin", "secret");
  ASSERT_TRUE(client.signed_in());
  for (const char* id : {"au-a", "au-c"}) {
    CgiAnswer log = client.Call("KIVO.Core.Package.Activity", "list", 1,
                                {{"package", id}, {"operation", "Installation.install"}});
    ASSERT_TRUE(log.Success()) << log.body;
    // The newest first: the upgrade, then kivoctl's install-server of 1.0.
    ASSERT_EQ(2u, log.Data()["entries"].size()) << log.body;
    EXPECT_EQ("kivoctl", log.Data()["entries"][1u]["origin"].asString()) << log.body;
    const Json::Value& e = log.Data()["entries"][0u];
    EXPECT_EQ("auto-update", e["origin"].asString()) << log.body;
    EXPECT_EQ("auto-update", e["actor"].asString()) << log.body;
    EXPECT_EQ("success", e["state"].asString());
    EXPECT_EQ("1.0", e["target"]["from_version"].asString());
    EXPECT_EQ("2.0", e["target"]["version"].asString());
  }
  EXPECT_EQ(1u, client
                    .Call("KIVO.Core.Package.Activity", "list", 1,
                          {{"package", "au-b"}, {"operation", "Installation.install"}})
                    .Data()["entries"]
                    .size());  // its install-server only

  // Once per opening: a later run in the same opening leaves everything.
  Offer("au-a", {}, false, "3.0");
  Serve();
  ASSERT_EQ(0, AutoUpdateAt("2024-05-06T04:00", &out)) << out;
  EXPECT_NE(std::string::npos,
            out.find("already ran in this opening of the maintenance window (mon 02:00-05:00, at "
                     "2024-05-06 03:00); it opens next at 2024-05-13 02:00"))
      << out;
  EXPECT_EQ("au-a 2.0 running", State("au-a"));
  ASSERT_EQ(0, AutoUpdateAt("2024-05-13T02:30", &out)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: upgraded 2.0 -> 3.0")) << out;
}

TEST_F(AutoUpdateTest, AHoldUntilADayThatBeganNoLongerHolds) {
  InstallOld("au-a");
  InstallOld("au-b");
  Offer("au-a");
  Offer("au-b");
  Serve();
  Holds(R"({"au-a": {"until": "2020-01-01", "since": 1500000000, "by": "admin"},
            "au-b": {"until": "2999-01-01", "since": 1500000000, "by": "admin"}})");
  std::string out;
  ASSERT_EQ(0, AutoUpdate(&out, true)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: would upgrade 1.0 -> 2.0")) << out;
  EXPECT_NE(std::string::npos, out.find("au-b: skipped: held until 2999-01-01")) << out;
  ASSERT_EQ(0, AutoUpdate(&out)) << out;
  EXPECT_EQ("au-a 2.0 running", State("au-a"));
  EXPECT_EQ("au-b 1.0 running", State("au-b"));
  // On the day the hold names, it no longer holds.
  ASSERT_EQ(0, AutoUpdateAt("2999-01-01T00:00", &out, true)) << out;
  EXPECT_NE(std::string::npos, out.find("au-b: would upgrade 1.0 -> 2.0")) << out;
  ASSERT_EQ(0, AutoUpdateAt("2998-12-31T23:59", &out, true)) << out;
  EXPECT_NE(std::string::npos, out.find("au-b: skipped: held until 2999-01-01")) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: skipped: no newer version offered")) << out;
}

// A window or holds that fail a check are no licence to upgrade: the run
// stops whole, says why, and asks no server.
TEST_F(AutoUpdateTest, ABadWindowOrBadHoldsUpgradeNothing) {
  InstallOld("au-a");
  Offer("au-a");
  Serve();
  const int asked = server_.Requests("/vendor/catalogue.json");
  std::string out;
  for (const std::string& bad :
       {std::string("window_days=\"funday\"\nwindow_start=\"02:00\"\nwindow_end=\"05:00\"\n"),
        std::string("window_days=\"mon\"\n"), std::string(kMondayWindow) + "surprise=\"1\"\n",
        std::string(kMondayWindow) + "this is no setting\n",
        std::string("window_days=\"mon\"\nwindow_start=\"02:00\"\nwindow_end=\"05:00\"\n"
                    "random_delay_minutes=\"721\"\n")}) {
    Window(bad);
    EXPECT_EQ(1, AutoUpdateAt("2024-05-06T03:00", &out)) << bad << out;
    EXPECT_NE(std::string::npos, out.find("/etc/kivo/autoupdate.conf is not valid (")) << out;
    EXPECT_NE(std::string::npos, out.find("); nothing is upgraded")) << out;
  }
  Window(kMondayWindow);
  for (const std::string& bad :
       {std::string("not json"),
        std::string(R"({"au-a": {"until": "2024-02-30", "since": 1, "by": "admin"}})"),
        std::string(R"({"../x": {"until": null, "since": 1, "by": "admin"}})"),
        std::string(R"({"au-a": {"until": null, "since": 1, "by": "admin", "x": 1}})")}) {
    Holds(bad);
    EXPECT_EQ(1, AutoUpdateAt("2024-05-06T03:00", &out)) << bad << out;
    EXPECT_NE(std::string::npos,
              out.find("the holds of automatic updates cannot be read; nothing is upgraded"))
        << out;
  }
  EXPECT_EQ(asked, server_.Requests("/vendor/catalogue.json"));
  EXPECT_EQ("au-a 1.0 running", State("au-a"));
  EXPECT_EQ(2, AutoUpdate(&out, true, {"--now", "2024-05-06 25:00"})) << out;
  EXPECT_EQ(2, AutoUpdate(&out, true, {"--seed", "x"})) << out;
}

// "would wait N s (the random delay, until HH:MM) before ..." -> N.
long long SaidDelay(const std::string& out) {
  const std::string mark = "would wait ";
  const size_t at = out.find(mark);
  return at == std::string::npos ? -1 : std::stoll(out.substr(at + mark.size()));
}

TEST_F(AutoUpdateTest, TheRandomDelayEndsBeforeTheWindowDoes) {
  InstallOld("au-a");
  Offer("au-a");
  Serve();
  Window(
      "window_days=\"mon\"\nwindow_start=\"02:00\"\nwindow_end=\"05:00\"\n"
      "random_delay_minutes=\"60\"\n");
  std::string out;
  bool long_delay = false;
  for (const char* seed : {"1", "2", "3", "4", "5", "6", "7", "8"}) {
    ASSERT_EQ(0, AutoUpdateAt("2024-05-06T02:00", &out, true, {"--seed", seed})) << out;
    const long long early = SaidDelay(out);
    EXPECT_LT(early, 3600) << out;
    long_delay = long_delay || early >= 300;
    EXPECT_NE(std::string::npos, out.find("au-a: would upgrade 1.0 -> 2.0")) << out;
    // Five minutes before the window closes, the delay ends before it.
    ASSERT_EQ(0, AutoUpdateAt("2024-05-06T04:55", &out, true, {"--seed", seed})) << out;
    const long long late = SaidDelay(out);
    EXPECT_LT(late, 300) << out;
    // The same seed, the same delay.
    ASSERT_EQ(0, AutoUpdateAt("2024-05-06T02:00", &out, true, {"--seed", seed})) << out;
    EXPECT_EQ(early, SaidDelay(out)) << out;
  }
  EXPECT_TRUE(long_delay);
}

TEST_F(AutoUpdateTest, TheWebAPISetsTheWindowAndHoldsWhole) {
  InstallOld("au-a");
  Offer("au-a");
  Serve();
  root_.AddAccount("admin", "secret", {"administrators"});
  root_.AddAccount("someone", "secret", {});
  ApiClient client("admin", "secret");
  ASSERT_TRUE(client.signed_in());
  constexpr char kApi[] = "KIVO.Core.Package.AutoUpdate";
  CgiAnswer got = client.Call(kApi, "get", 1);
  ASSERT_TRUE(got.Success()) << got.body;
  EXPECT_EQ("all", got.Data()["mode"].asString());
  EXPECT_FALSE(got.Data()["window"]["limited"].asBool());
  EXPECT_TRUE(got.Data()["last_run"].isNull());
  EXPECT_TRUE(got.Data()["next_run"].isNull());  // any time

  CgiAnswer set = client.Call(kApi, "set", 1,
                              {{"limited", "true"},
                               {"days", "[\"thu\",\"mon\"]"},
                               {"start", "22:00"},
                               {"end", "02:00"},
                               {"random_delay_minutes", "30"}});
  ASSERT_TRUE(set.Success()) << set.body;
  const std::string stored = FileText(root_.Path("/etc/kivo/autoupdate.conf"));
  EXPECT_NE(std::string::npos, stored.find("window_days=\"mon,thu\"\n")) << stored;
  EXPECT_NE(std::string::npos, stored.find("window_end=\"02:00\"\n")) << stored;
  EXPECT_EQ("22:00", set.Data()["window"]["start"].asString());
  ASSERT_TRUE(set.Data()["next_run"].isObject()) << set.body;
  EXPECT_LT(set.Data()["next_run"]["opens"].asInt64(), set.Data()["next_run"]["closes"].asInt64());

  // Any bad part refuses all of it, naming the part.
  const std::vector<std::pair<Params, std::string>> bad = {
      {{{"limited", "true"}, {"days", "[\"mon\"]"}, {"start", "22:00"}, {"end", "25:00"}}, "end"},
      {{{"limited", "true"}, {"days", "[\"funday\"]"}, {"start", "01:00"}, {"end", "02:00"}},
       "days"},
      {{{"limited", "true"}, {"days", "mon,mon"}, {"start", "01:00"}, {"end", "02:00"}}, "days"},
      {{{"limited", "true"}, {"start", "01:00"}, {"end", "02:00"}}, "days"},
      {{{"limited", "true"}, {"days", "[\"mon\"]"}, {"start", "01:00"}, {"end", "01:00"}}, "end"},
      {{{"limited", "false"}, {"start", "01:00"}}, "start"},
      {{{"limited", "false"}, {"random_delay_minutes", "721"}}, "random_delay_minutes"},
      {{{"limited", "false"}, {"random_delay_minutes", "1; DROP"}}, "random_delay_minutes"},
      {{{"limited", "maybe"}}, "limited"},
  };
  for (const auto& [params, name] : bad) {
    CgiAnswer refused = client.Call(kApi, "set", 1, params);
    EXPECT_EQ(120, refused.Code()) << refused.body;
    EXPECT_EQ(name, refused.Errors()["name"].asString()) << refused.body;
  }
  EXPECT_EQ(stored, FileText(root_.Path("/etc/kivo/autoupdate.conf")));

  // Holds: a day still to come or until lifted, of an installed package.
  for (const auto& [until, name] : std::vector<std::pair<std::string, std::string>>{
           {"2020-01-01", "until"}, {"2999-02-30", "until"}, {"soon", "until"}}) {
    CgiAnswer refused = client.Call(kApi, "hold", 1, {{"id", "au-a"}, {"until", until}});
    EXPECT_EQ(120, refused.Code()) << refused.body;
    EXPECT_EQ(name, refused.Errors()["name"].asString()) << refused.body;
  }
  EXPECT_EQ(120, client.Call(kApi, "hold", 1, {{"id", "../au-a"}}).Code());
  EXPECT_EQ(4630, client.Call(kApi, "hold", 1, {{"id", "au-zz"}}).Code());
  EXPECT_NE(0, access(root_.Path("/usr/kivo/etc/packages/autoupdate-holds.json").c_str(), F_OK));
  CgiAnswer held = client.Call(kApi, "hold", 1, {{"id", "au-a"}, {"until", "2999-12-31"}});
  ASSERT_TRUE(held.Success()) << held.body;
  EXPECT_EQ("2999-12-31", held.Data()["holds"]["au-a"]["until"].asString());
  EXPECT_EQ("admin", held.Data()["holds"]["au-a"]["by"].asString());
  EXPECT_TRUE(held.Data()["holds"]["au-a"]["active"].asBool());

  // The tool honours the hold the page set.
  Window("");
  std::string out;
  ASSERT_EQ(0, AutoUpdate(&out)) << out;
  EXPECT_NE(std::string::npos, out.find("au-a: skipped: held until 2999-12-31")) << out;
  CgiAnswer after = client.Call(kApi, "get", 1);
  EXPECT_EQ("held", after.Data()["last_run"]["packages"]["au-a"]["outcome"].asString())
      << after.body;

  CgiAnswer released = client.Call(kApi, "release", 1, {{"id", "au-a"}});
  ASSERT_TRUE(released.Success()) << released.body;
  EXPECT_TRUE(released.Data()["lifted"].asBool());
  EXPECT_FALSE(released.Data()["holds"].isMember("au-a"));

  // Changes are on record; reads are not.
  CgiAnswer log = client.Call("KIVO.Core.Package.Activity", "list", 1,
                              {{"operation", "AutoUpdate.hold"}, {"outcome", "success"}});
  ASSERT_EQ(1u, log.Data()["entries"].size()) << log.body;
  EXPECT_EQ("2999-12-31", log.Data()["entries"][0u]["target"]["until"].asString());
  EXPECT_EQ("admin", log.Data()["entries"][0u]["actor"].asString());
  EXPECT_EQ(1u, client
                    .Call("KIVO.Core.Package.Activity", "list", 1,
                          {{"operation", "AutoUpdate.set"}, {"outcome", "success"}})
                    .Data()["entries"]
                    .size());
  EXPECT_EQ(0u,
            client.Call("KIVO.Core.Package.Activity", "list", 1, {{"operation", "AutoUpdate.get"}})
                .Data()["entries"]
                .size());

  // Administrators only.
  ApiClient someone("someone", "secret");
  ASSERT_TRUE(someone.signed_in());
  EXPECT_EQ(105, someone.Call(kApi, "get", 1).Code());
  EXPECT_EQ(105, someone.Call(kApi, "hold", 1, {{"id", "au-a"}}).Code());
}

}  // namespace
