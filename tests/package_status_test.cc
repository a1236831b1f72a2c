// The status of an installed package through every reader the host serves:
// "list" and "get", the catalogue, an upload's description and a downloaded
// file's check. They read the package's tasks and the package tool by one
// rule, so whatever the package is doing, they all say the same.

#include <map>
#include <memory>
#include <string>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include <gtest/gtest.h>

#include "taskmgr/task.h"
#include "testing/admin_api_test.h"
#include "testing/catalogue_feed.h"
#include "testing/http_test_server.h"
#include "testing/package_factory.h"

namespace {

constexpr char kPkg[] = "KIVO.Core.Package";
constexpr char kInstallTask[] = "@KIVOPKG_DOWNLOAD_app";
constexpr char kStartStopTask[] = "@KIVOPKG_STARTSTOP_app";
constexpr char kUninstallTask[] = "@KIVOPKG_UNINSTALL_app";

using Statuses = std::map<std::string, std::string>;
const std::vector<std::string> kReaders = {"list", "get", "catalogue", "upload"};
const std::vector<std::string> kReadersAndCheck = {"list", "get", "catalogue", "upload",
                                                   "download check"};

class PackageStatusTest : public AdminApiTest {
 protected:
  // "app" 1.0 installed (not running) from the vendor's server; 2.0 built
  // beside it for the upload and the download.
  void SetUp() override {
    Trust(1);
    root_.Write("/etc/kivo/pkgserver.conf", "vendor_url=\"" + feed_.Url() +
                                                "\"\nconnect_timeout=\"2\"\n"
                                                "catalogue_timeout=\"2\"\n");
    TestPackage app;
    app.id = "app";
    ASSERT_TRUE(feed_.Offer(app));
    std::string out;
    ASSERT_EQ(0, Kivoctl({"install-server", "app"}, &out)) << out;
    app.version = "2.0";
    newer_ = app.Build(root_.Path("/tmp/packages"));
  }
  void TearDown() override { StopInstalledPackages(); }

  // A living process whose pid a task can name: this test's.
  static pid_t Living() { return getpid(); }
  // The pid of a process that has ended.
  static pid_t Ended() {
    pid_t pid = fork();
    if (pid == 0) _exit(0);
    waitpid(pid, nullptr, 0);
    return pid;
  }
  static void Task(const std::string& id, const Json::Value& data) {
    std::unique_ptr<NVX::Task> task(GetNewTask("@administrators", id.c_str()));
    ASSERT_TRUE(task && task->setProperty("data", data));
  }
  static bool HasTask(const std::string& id) { return NVX::TaskMgr("@administrators").hasTask(id); }

  // The download of 2.0 as its worker leaves it when the file is in.
  void FinishedDownload() {
    const std::string folder = root_.Path("/volume1/@tmp/download-app");
    ASSERT_EQ(0, RunProgram({"mkdir", "-p", folder}, nullptr));
    ASSERT_EQ(0, RunProgram({"cp", newer_, folder + "/" + kInstallTask}, nullptr));
    Json::Value data(Json::objectValue);
    data["id"] = "app";
    data["taskid"] = kInstallTask;
    data["pid"] = Ended();
    data["tmp_folder"] = folder;
    data["installing"] = false;
    data["status"] = "downloaded";
    std::unique_ptr<NVX::Task> task(GetNewTask("@administrators", kInstallTask));
    ASSERT_TRUE(task && task->setProperty("data", data) && task->setProperty("progress", 1.0) &&
                task->finish(true));
  }

  // The status of "app" by each reader but the downloaded file's check.
  Statuses Read() {
    const Params additional = {{"additional", "[\"status\"]"}};
    Statuses s;
    const CgiAnswer list = client().Call(kPkg, "list", 1, additional);
    for (const Json::Value& p : list.Data()["packages"]) {
      if (p["id"].asString() == "app") s["list"] = p["additional"]["status"].asString();
    }
    Params get = additional;
    get.push_back({"id", "[\"app\"]"});
    s["get"] = client().Call(kPkg, "get", 1, get).Data()["additional"]["status"].asString();
    s["catalogue"] =
        CatalogueEntry(client().Call("KIVO.Core.Package.Server", "list", 1), "app")["status"]
            .asString();
    CgiAnswer upload =
        client().Upload("KIVO.Core.Package.Installation", "upload", 1, additional, newer_);
    s["upload"] = upload.Data()["additional"]["status"].asString();
    return s;
  }
  // The same with the check of the finished download.
  Statuses ReadWithDownloadCheck() {
    Statuses s = Read();
    s["download check"] =
        client()
            .Call("KIVO.Core.Package.Installation.Download", "check", 1, {{"taskid", kInstallTask}})
            .Data()["status"]
            .asString();
    return s;
  }
  // `status` from each of `readers`.
  static Statuses All(const std::string& status, const std::vector<std::string>& readers) {
    Statuses s;
    for (const std::string& reader : readers) s[reader] = status;
    return s;
  }

  HttpTestServer server_;
  CatalogueFeed feed_{server_, root_.Path("/feed"), "/feed"};
  std::string newer_;
};

TEST_F(PackageStatusTest, EveryReaderShowsAnUninstallUnderWay) {
  FinishedDownload();
  EXPECT_EQ(All("stop", kReadersAndCheck), ReadWithDownloadCheck());
  Json::Value uninstall(Json::objectValue);
  uninstall["pid"] = Living();
  Task(kUninstallTask, uninstall);
  EXPECT_EQ(All("uninstalling", kReadersAndCheck), ReadWithDownloadCheck());
  EXPECT_TRUE(HasTask(kUninstallTask));
}

TEST_F(PackageStatusTest, EveryReaderShowsAStartUnderWayAndForgetsItWhenItsWorkerIsGone) {
  FinishedDownload();
  Json::Value start(Json::objectValue);
  start["status"] = "starting";
  start["pid"] = Living();
  Task(kStartStopTask, start);
  EXPECT_EQ(All("starting", kReadersAndCheck), ReadWithDownloadCheck());
  start["pid"] = Ended();
  Task(kStartStopTask, start);
  EXPECT_EQ(All("stop", kReadersAndCheck), ReadWithDownloadCheck());
  EXPECT_FALSE(HasTask(kStartStopTask));
}

TEST_F(PackageStatusTest, EveryReaderShowsAnInstallUnderWayWithItsProgress) {
  Json::Value install(Json::objectValue);
  install["installing"] = true;
  install["status"] = "upgrading";
  install["pid"] = Living();
  Task(kInstallTask, install);
  root_.Write("/run/kivo/pkgtool/progress/app", "0.4\n");
  EXPECT_EQ(All("upgrading", kReaders), Read());
  CgiAnswer list =
      client().Call(kPkg, "list", 1, {{"additional", "[\"status\",\"installing_progress\"]"}});
  EXPECT_DOUBLE_EQ(0.4, list.Data()["packages"][0]["additional"]["installing_progress"].asDouble());
  CgiAnswer catalogue = client().Call("KIVO.Core.Package.Server", "list", 1);
  EXPECT_DOUBLE_EQ(0.4, CatalogueEntry(catalogue, "app")["installing_progress"].asDouble());
}

// A task is created before its starter writes its data (the worker's pid
// among them): a reader that comes in between must leave it alone.
TEST_F(PackageStatusTest, TasksThatNameNoWorkerYetAreLeftToTheirStarters) {
  for (const char* id : {kInstallTask, kStartStopTask, kUninstallTask}) {
    std::unique_ptr<NVX::Task> task(GetNewTask("@administrators", id));
    ASSERT_TRUE(task);
  }
  EXPECT_EQ(All("stop", kReaders), Read());
  EXPECT_TRUE(HasTask(kInstallTask));
  EXPECT_TRUE(HasTask(kStartStopTask));
  EXPECT_TRUE(HasTask(kUninstallTask));
}

}  // namespace
