// "list" and "get" of KIVO.Core.Package through the real host, on packages
// installed by the package tool.

#include <memory>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "pkgtool/package_manager.h"
#include "taskmgr/task.h"
#include "testing/admin_api_test.h"
#include "testing/cgi_client.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

const char kAllKeys[] =
    "[\"autoupdate\",\"beta\",\"description\",\"description_enu\",\"distributor\","
    "\"distributor_url\",\"nvx_apps\",\"help_url\",\"install_reboot\",\"install_type\","
    "\"installed_info\",\"is_uninstall_pages\",\"maintainer\",\"maintainer_url\",\"url\","
    "\"report_beta_url\",\"silent_install\",\"silent_upgrade\",\"silent_uninstall\",\"startable\","
    "\"status\",\"support_center\",\"support_url\",\"uninstall_pages\",\"dependent_packages\","
    "\"start_dependent_services\",\"installing_progress\",\"ctl_uninstall\",\"log_path\"]";

class ListGetTest : public AdminApiTest {
 protected:
  void SetUp() override {
    Trust(1);
    dir_ = root_.Path("/tmp/packages");
  }
  void TearDown() override {
    KillAndReap(sleepers_);
    for (const char* id : {"web-app", "beta-app", "plain"}) Kivoctl({"stop", id});
  }

  void Install(const TestPackage& p, std::vector<std::string> extra = {}) {
    std::vector<std::string> args = {"install", p.Build(dir_)};
    args.insert(args.end(), extra.begin(), extra.end());
    std::string out;
    ASSERT_EQ(0, Kivoctl(args, &out)) << out;
  }
  CgiAnswer List(const std::string& additional = "", const std::string& api = "KIVO.Core.Package") {
    Params params;
    if (!additional.empty()) params.push_back({"additional", additional});
    return client().Call(api, "list", 1, params);
  }
  // The package object of `id` in a list answer.
  static Json::Value Find(const CgiAnswer& a, const std::string& id) {
    for (const Json::Value& p : a.Data()["packages"]) {
      if (p["id"].asString() == id) return p;
    }
    return Json::Value();
  }
  // A living process whose pid tasks can name.
  pid_t Sleeper() {
    pid_t pid = fork();
    if (pid == 0) {
      execlp("sleep", "sleep", "60", static_cast<char*>(nullptr));
      _exit(1);
    }
    sleepers_.push_back(pid);
    return pid;
  }
  void Task(const std::string& id, const Json::Value& data) {
    std::unique_ptr<NVX::Task> task(GetNewTask("@administrators", id.c_str()));
    ASSERT_TRUE(task && task->setProperty("data", data));
  }

  std::string dir_;
  std::vector<pid_t> sleepers_;
};

TEST_F(ListGetTest, BaseMembersOnlyWithoutAdditional) {
  TestPackage a, b;
  a.id = "alpha";
  b.id = "bravo";
  b.info = {{"displayname", "Bravo App"}, {"displayname_ger", "Bravo-Anwendung"}};
  Install(a);
  Install(b);
  CgiAnswer list = List();
  ASSERT_TRUE(list.Success()) << list.body;
  EXPECT_EQ(2u, list.Data()["total"].asUInt());
  Json::Value bravo = Find(list, "bravo");
  EXPECT_EQ((std::vector<std::string>{"id", "name", "version"}), bravo.getMemberNames());
  EXPECT_EQ("Bravo App", bravo["name"].asString());
  EXPECT_EQ(list.body, List("", "KIVO.Package").body);  // the legacy name answers the same

  CgiAnswer empty_root = ApiClient("admin", "secret").Call("KIVO.Core.Package", "list", 1);
  EXPECT_EQ(2u, empty_root.Data()["packages"].size());
}

TEST_F(ListGetTest, EveryAdditionalMember) {
  TestPackage web;
  web.id = "web-app";
  web.info = {{"adminport", "18095"},
              {"adminurl", "/ui"},
              {"checkport", "no"},
              {"beta", "yes"},
              {"description", "Serves pages"},
              {"maintainer", "Ada"},
              {"helpurl", "https://h"},
              {"report_url", "https://r"},
              {"silent_install", "yes"},
              {"silent_uninstall", "yes"},
              {"install_dep_services", "pgsql:web"},
              {"ctl_uninstall", "yes"},
              {"logfile", "web.log"},
              {"support_center", "yes"},
              {"nvx_apps", "web.App"}};
  web.members = {{"WIZARD_UIFILES/uninstall_uifile", "[{\"step_title\": \"Bye & thanks\"}]"},
                 {"LICENSE", "Be nice."}};
  Install(web, {"--run"});
  TestPackage plain;
  plain.id = "plain";
  plain.info = {{"install_dep_packages", "web-app>=1.0"}};
  Install(plain);

  CgiAnswer a =
      client().Call("KIVO.Core.Package", "get", 1, {{"id", "web-app"}, {"additional", kAllKeys}});
  ASSERT_TRUE(a.Success()) << a.body;
  const Json::Value& x = a.Data()["additional"];
  EXPECT_EQ("running", x["status"].asString());
  EXPECT_TRUE(x["beta"].asBool());
  EXPECT_EQ("Serves pages", x["description"].asString());
  EXPECT_EQ("Serves pages", x["description_enu"].asString());
  EXPECT_EQ("https://h", x["help_url"].asString());
  EXPECT_EQ("https://r", x["report_beta_url"].asString());
  EXPECT_TRUE(x["silent_install"].asBool());
  EXPECT_TRUE(x["silent_uninstall"].asBool());
  EXPECT_FALSE(x["silent_upgrade"].asBool());
  EXPECT_TRUE(x["support_center"].asBool());
  EXPECT_TRUE(x["startable"].asBool());
  EXPECT_TRUE(x["ctl_uninstall"].asBool());
  EXPECT_TRUE(x["is_uninstall_pages"].asBool());
  EXPECT_EQ("%5B%7B%22step_title%22%3A%22Bye%20%26%20thanks%22%7D%5D",
            x["uninstall_pages"].asString());
  EXPECT_EQ("web.App", x["nvx_apps"].asString());
  EXPECT_EQ("pgsql", x["start_dependent_services"][0].asString());
  EXPECT_EQ(2u, x["start_dependent_services"].size());
  EXPECT_FALSE(x["autoupdate"].asBool());
  EXPECT_FALSE(x.isMember("log_path"));  // get never writes it
  EXPECT_EQ(0u,
            x["installed_info"]["path"].asString().find(root_.Path("/volume1/@appstore/web-app.")));
  EXPECT_FALSE(x["installed_info"]["is_brick"].asBool());
  EXPECT_EQ("http://nas.example:18095/ui", x["url"].asString());  // the host the request came to

  CgiAnswer list = List(kAllKeys);
  Json::Value p = Find(list, "plain")["additional"];
  EXPECT_EQ("stop", p["status"].asString());
  EXPECT_FALSE(p["beta"].asBool());
  EXPECT_EQ(">=", p["dependent_packages"]["web-app"]["operator"].asString());
  EXPECT_FALSE(p.isMember("url"));
  EXPECT_EQ(root_.Path("/var/packages/web-app/var/web.log"),
            Find(list, "web-app")["additional"]["log_path"].asString());
}

TEST_F(ListGetTest, SilentUninstallFollowsTheSilentInstallBit) {
  TestPackage p;
  p.info = {{"silent_uninstall", "yes"}};
  Install(p);
  Json::Value only = Find(List("[\"silent_uninstall\"]"), "test-app");
  EXPECT_TRUE(only["additional"].empty()) << only.toStyledString();
  Json::Value both = Find(List("[\"silent_install\"]"), "test-app")["additional"];
  EXPECT_FALSE(both["silent_install"].asBool());
  EXPECT_TRUE(both["silent_uninstall"].asBool());
  // Case does not matter for the names (the legacy API has no checker).
  EXPECT_EQ(
      "stop",
      Find(List("[\"STATUS\"]", "KIVO.Package"), "test-app")["additional"]["status"].asString());
}

TEST_F(ListGetTest, GetUnknownBrokenAndInitFailure) {
  EXPECT_EQ(4545, client().Call("KIVO.Core.Package", "get", 1, {{"id", "nothing"}}).Code());
  // An id that breaks the id rule never reaches the package tool.
  CgiAnswer hostile = client().Call("KIVO.Core.Package", "get", 1, {{"id", "[\"../etc\"]"}});
  EXPECT_EQ(120, hostile.Code());
  EXPECT_EQ("condition", hostile.Errors()["reason"].asString());
  TestPackage p;
  Install(p);
  // The installed files vanish: the package is still there, and broken.
  PackageManager pm;
  PackageInfo info;
  ASSERT_TRUE(pm.getPackageInfo("test-app", info));
  RunProgram({"rm", "-rf", info.getTarget()}, nullptr);
  CgiAnswer broken = client().Call("KIVO.Core.Package", "get", 1,
                                   {{"id", "test-app"}, {"additional", "[\"status\"]"}});
  ASSERT_TRUE(broken.Success()) << broken.body;
  EXPECT_EQ("broken", broken.Data()["additional"]["status"].asString());
}

TEST_F(ListGetTest, StatusFollowsLiveTasks) {
  TestPackage p;
  Install(p);
  auto status = [this]() {
    return Find(List("[\"status\",\"installing_progress\"]"), "test-app")["additional"];
  };
  Json::Value data(Json::objectValue);
  data["status"] = "starting";
  data["pid"] = Sleeper();
  Task("@KIVOPKG_STARTSTOP_test-app", data);
  EXPECT_EQ("starting", status()["status"].asString());
  data["pid"] = 999999;  // a dead worker: the task goes, the installed state shows
  Task("@KIVOPKG_STARTSTOP_test-app", data);
  EXPECT_EQ("stop", status()["status"].asString());
  EXPECT_FALSE(NVX::TaskMgr("@administrators").hasTask("@KIVOPKG_STARTSTOP_test-app"));

  Json::Value install(Json::objectValue);
  install["installing"] = true;
  install["status"] = "upgrading";
  install["pid"] = Sleeper();
  Task("@KIVOPKG_DOWNLOAD_test-app", install);
  root_.Write("/run/kivo/pkgtool/progress/test-app", "0.4\n");
  EXPECT_EQ("upgrading", status()["status"].asString());
  EXPECT_DOUBLE_EQ(0.4, status()["installing_progress"].asDouble());
  install["pid"] = 999999;
  Task("@KIVOPKG_DOWNLOAD_test-app", install);
  EXPECT_EQ("stop", status()["status"].asString());

  Json::Value uninstall(Json::objectValue);
  uninstall["pid"] = Sleeper();
  Task("@KIVOPKG_UNINSTALL_test-app", uninstall);
  EXPECT_EQ("uninstalling", status()["status"].asString());
  // A task without data shows no operation.
  std::unique_ptr<NVX::Task> bare(GetNewTask("@administrators", "@KIVOPKG_UNINSTALL_test-app"));
  EXPECT_EQ("stop", status()["status"].asString());
}

TEST_F(ListGetTest, AutoUpdateFlagUnderEverySetting) {
  TestPackage a, b;
  a.id = "chosen";
  b.id = "other";
  Install(a);
  Install(b);
  root_.Write("/usr/kivo/etc/packages/autoupdate.json", "[\"chosen\"]");
  auto flags = [this]() {
    CgiAnswer list = List("[\"autoupdate\"]");
    return std::make_pair(Find(list, "chosen")["additional"]["autoupdate"].asBool(),
                          Find(list, "other")["additional"]["autoupdate"].asBool());
  };
  root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"1\"\n");
  EXPECT_EQ(std::make_pair(false, false), flags());  // automatic update off: even the chosen one
  root_.Write("/etc/kivoinfo.conf",
              "enable_pkg_autoupdate_all=\"yes\"\npkg_autoupdate_all=\"no\"\n");
  EXPECT_EQ(std::make_pair(true, false), flags());
  root_.Write("/etc/kivoinfo.conf",
              "enable_pkg_autoupdate_all=\"yes\"\npkg_autoupdate_all=\"yes\"\n");
  EXPECT_EQ(std::make_pair(true, true), flags());
  root_.Write("/etc/kivoinfo.conf",
              "enable_pkg_autoupdate_all=\"no\"\npkg_autoupdate_all=\"yes\"\n");
  EXPECT_EQ(std::make_pair(false, false), flags());
}

TEST_F(ListGetTest, BrickFlagPerVolume) {
  root_.Write("/etc/kivo/volumes.json",
              "[{\"path\": \"/volume1\", \"status\": \"normal\", \"brick\": true},"
              " {\"path\": \"/volume2\", \"status\": \"normal\"}]");
  ASSERT_EQ(0, KIVOFSMkdirP(root_.Path("/volume2").c_str()));
  TestPackage a, b, c;
  a.id = "on-brick-1";
  b.id = "on-brick-2";
  c.id = "on-plain";
  Install(a, {"--volume", "/volume1"});
  Install(b, {"--volume", "/volume1"});
  Install(c, {"--volume", "/volume2"});
  CgiAnswer list = List("[\"installed_info\"]");
  EXPECT_TRUE(Find(list, "on-brick-1")["additional"]["installed_info"]["is_brick"].asBool());
  EXPECT_TRUE(Find(list, "on-brick-2")["additional"]["installed_info"]["is_brick"].asBool());
  EXPECT_FALSE(Find(list, "on-plain")["additional"]["installed_info"]["is_brick"].asBool());
  EXPECT_EQ(0u, Find(list, "on-plain")["additional"]["installed_info"]["path"].asString().find(
                    root_.Path("/volume2/@appstore/on-plain.")));
}

}  // namespace
