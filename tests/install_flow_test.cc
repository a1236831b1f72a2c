// Installing from a package file through the real host: upload, check,
// install, status and cancel, clean and delete.

#include <memory>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "klibc/process.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "taskmgr/sqlite_api.h"
#include "taskmgr/task.h"
#include "testing/admin_api_test.h"
#include "testing/cgi_client.h"
#include "testing/gpg_keys.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

constexpr char kInst[] = "KIVO.Core.Package.Installation";

class InstallFlowTest : public AdminApiTest {
 protected:
  void SetUp() override {
    Trust(1);
    dir_ = root_.Path("/tmp/packages");
  }
  void TearDown() override {
    KillAndReap(children_);
    StopInstalledPackages();
  }
  CgiAnswer Upload(const std::string& file, const Params& fields = {}) {
    return client().Upload(kInst, "upload", 1, fields, file);
  }
  // Uploads test-app whose preinst script is `preinst`.
  CgiAnswer UploadWithPreinst(const std::string& preinst) {
    TestPackage app;
    app.scripts = {{"preinst", preinst}};
    return Upload(app.Build(dir_));
  }
  // Uploads a package `id` whose INFO adds `info`.
  CgiAnswer UploadWithInfo(const std::string& id, const std::map<std::string, std::string>& info) {
    return Upload(PackageWithInfo(id, info).Build(dir_));
  }
  CgiAnswer Call(const std::string& method, const Params& params, int version = 1) {
    return client().Call(kInst, method, version, params);
  }
  // Files left in the upload area.
  int Uploads() {
    std::string out;
    RunProgram(
        {"sh", "-c", "ls -A '" + root_.Path("/volume1/@tmp/upload") + "' 2>/dev/null | wc -l"},
        &out);
    return std::atoi(out.c_str());
  }
  pid_t Spawn(const std::vector<std::string>& argv) {
    pid_t pid = fork();
    if (pid == 0) {
      setpgid(0, 0);
      std::vector<char*> args;
      for (const std::string& a : argv) args.push_back(const_cast<char*>(a.c_str()));
      args.push_back(nullptr);
      execvp(args[0], args.data());
      _exit(1);
    }
    children_.push_back(pid);
    return pid;
  }

  // Polls "status" of the install task of `id` until `done` says so (at
  // most about 6 s); returns the last answer's data.
  template <typename Done>
  Json::Value PollStatus(const std::string& id, Done done) {
    Json::Value data;
    for (int i = 0; i < 300; ++i) {
      data = Call("status", {{"task_id", "@KIVOPKG_DOWNLOAD_" + id}}).Data();
      if (done(data)) break;
      usleep(20000);
    }
    return data;
  }
  // Posts `body` as a multipart upload with the signed-in session.
  CgiAnswer PostBody(const std::string& body, const std::string& boundary) {
    return RunEntryCgi(
        {{"REQUEST_METHOD", "POST"},
         {"QUERY_STRING", "api=KIVO.Core.Package.Installation&method=upload&version=1"},
         {"CONTENT_TYPE", "multipart/form-data; boundary=" + boundary},
         {"CONTENT_LENGTH", std::to_string(body.size())},
         {"HTTP_COOKIE", "id=" + client().sid()},
         {"HTTP_X_KIVO_TOKEN", client().token()}},
        body);
  }
  // Runs `sql` on the root's task database, as an operator's tool would.
  void TaskStoreSql(const std::string& sql) {
    sqlite3* db = nullptr;
    ASSERT_EQ(SQLITE_OK, NVX::Sqlite()->open_v2(root_.Path("/run/kivo/tasks.db").c_str(), &db,
                                                SQLITE_OPEN_READWRITE, nullptr));
    EXPECT_EQ(SQLITE_OK, NVX::Sqlite()->exec(db, sql.c_str(), nullptr, nullptr, nullptr));
    NVX::Sqlite()->close(db);
  }

  std::string dir_;
  std::vector<pid_t> children_;
};

TEST_F(InstallFlowTest, UploadCheckInstallStatusList) {
  TestPackage app;
  app.info = {{"displayname", "Test App"}, {"install_dep_services", "pgsql"}};
  app.members = {{"LICENSE", "Use it well."},
                 {"WIZARD_UIFILES/install_uifile", "[{\"step_title\": \"Welcome\"}]"}};
  CgiAnswer up = Upload(app.Build(dir_), {{"additional", "[\"status\",\"beta\"]"}});
  ASSERT_TRUE(up.Success()) << up.body;
  const Json::Value& d = up.Data();
  EXPECT_EQ("test-app", d["id"].asString());
  EXPECT_EQ("Test App", d["name"].asString());
  EXPECT_EQ("Use%20it%20well.", d["licence"].asString());
  EXPECT_EQ("%5B%7B%22step_title%22%3A%22Welcome%22%7D%5D", d["install_pages"].asString());
  EXPECT_EQ("non_installed", d["additional"]["status"].asString());
  EXPECT_FALSE(d.isMember("codesign_error"));
  std::string task_id = d["task_id"].asString();
  EXPECT_EQ(0u, task_id.find("@KIVOPKG_UPLOAD_"));
  EXPECT_EQ(1, Uploads());

  CgiAnswer check = Call("check", {{"id", "test-app"}, {"depsers", "pgsql"}, {"size", "1000"}}, 2);
  ASSERT_TRUE(check.Success()) << check.body;
  EXPECT_EQ(1u, check.Data()["volume_count"].asUInt());
  EXPECT_FALSE(check.Data()["is_occupied"].asBool());

  CgiAnswer install =
      Call("install", {{"task_id", task_id}, {"installrunpackage", "true"}, {"type", "1"}});
  ASSERT_TRUE(install.Success()) << install.body;
  EXPECT_TRUE(install.Data()["worker_message"].isArray());
  EXPECT_FALSE(NVX::TaskMgr("@administrators").hasTask(task_id));
  EXPECT_EQ(0, Uploads());  // the installed upload is gone too
  EXPECT_TRUE(
      Call("status", {{"task_id", "@KIVOPKG_DOWNLOAD_test-app"}}).Data()["finished"].asBool());
  CgiAnswer list = client().Call("KIVO.Core.Package", "list", 1, {{"additional", "[\"status\"]"}});
  EXPECT_EQ("running", list.Data()["packages"][0]["additional"]["status"].asString());
}

TEST_F(InstallFlowTest, StatusShowsAnUpgradeInProgress) {
  TestPackage v1;
  ASSERT_EQ(0, Kivoctl({"install", v1.Build(dir_)}));
  TestPackage v2 = v1;
  v2.version = "2.0";
  v2.files = {{"data.bin", std::string(1 << 20, 'z')}};
  v2.scripts = {{"preupgrade", "sleep 2\n"}};
  std::string file = v2.Build(dir_);
  pid_t installer = fork();
  if (installer == 0) _exit(client().Call(kInst, "install", 1, {{"path", file}}).Success() ? 0 : 1);
  std::string status;
  double last_progress = -1;
  for (int i = 0; i < 150 && status != "upgrading"; ++i) {
    usleep(20000);
    CgiAnswer s = Call("status", {{"task_id", "@KIVOPKG_DOWNLOAD_test-app"}});
    status = s.Data()["status"].asString();
    last_progress = s.Data()["progress"].asDouble();
  }
  EXPECT_EQ("upgrading", status);
  EXPECT_GE(last_progress, 0.0);
  int exit_status;
  waitpid(installer, &exit_status, 0);
  EXPECT_EQ(0, WEXITSTATUS(exit_status));
  KeyValueMap info;
  ASSERT_TRUE(PackageRegistry::ReadInfo("test-app", &info));
  EXPECT_EQ("2.0", info["version"]);
}

TEST_F(InstallFlowTest, RefusalsAtUploadComeFromRealState) {
  root_.Write("/etc/kivo/device.conf", "os_version=\"7.2-0064\"\n");
  CgiAnswer low = UploadWithInfo("future", {{"os_min_ver", "9.0-0001"}});
  EXPECT_EQ(4538, low.Code());
  EXPECT_EQ("9.0-0001", low.Errors()["firmware"].asString());
  CgiAnswer high = UploadWithInfo("old", {{"os_max_ver", "6.2-0064"}});
  EXPECT_EQ("6.2-0064", high.Errors()["firmware"].asString());

  ASSERT_EQ(0, Kivoctl({"install", PackageWithInfo("base").Build(dir_)}));
  CgiAnswer conflict = UploadWithInfo("rival", {{"install_conflict_packages", "base"}});
  EXPECT_EQ(4524, conflict.Code());
  EXPECT_EQ("base", conflict.Errors()["packages"].asString());

  CgiAnswer dep = UploadWithInfo("needs", {{"install_dep_packages", "base:missing-one"}});
  EXPECT_EQ(4526, dep.Code());
  EXPECT_EQ("base", dep.Errors()["unstart_packages"].asString());
  EXPECT_EQ("missing-one", dep.Errors()["uninstall_packages"][0].asString());

  root_.Write("/etc/kivo/services.conf", "pgsql=\"stopped\"\n");
  CgiAnswer service = UploadWithInfo("db", {{"install_dep_services", "pgsql"}});
  EXPECT_EQ(4525, service.Code());
  EXPECT_EQ("pgsql", service.Errors()["services"][0].asString());

  TestPackage big;
  big.id = "big";
  big.files = {{"zeros", std::string(4 << 20, '\0')}};  // 4 MiB unpacked, a few KiB packed
  std::string big_file = big.Build(dir_);
  root_.Write("/etc/kivo/volumes.json",
              "[{\"path\": \"/volume1\", \"status\": \"normal\", \"cap_bytes\": 3000000}]");
  EXPECT_EQ(4504, Upload(big_file).Code());
  root_.Write("/etc/kivo/volumes.json",
              "[{\"path\": \"/volume1\", \"status\": \"normal\"}, {\"path\": \"/volume2\", "
              "\"status\": \"crashed\"}]");
  root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"1\"\npkg_def_volume=\"/volume2\"\n");
  EXPECT_EQ(4505, Upload(big_file).Code());
  root_.Write("/etc/kivo/volumes.json", "[]");
  EXPECT_EQ(4502, Upload(big_file).Code());  // nowhere to store the upload

  EXPECT_EQ(0, Uploads());  // refused uploads leave nothing behind
  std::string junk = dir_ + "/junk.kpk";
  root_.Write("/etc/kivo/volumes.json", "[{\"path\": \"/volume1\", \"status\": \"normal\"}]");
  ASSERT_TRUE(KIVOWriteFileAtomic(junk, "not a package", SyncToDisk::No));
  EXPECT_EQ(4521, Upload(junk).Code());
  EXPECT_EQ(0, Uploads());
}

TEST_F(InstallFlowTest, CodeSignatureIsLenientAtUploadAndStrictAtInstall) {
  TestKeys keys(root_.Path("/tmp"));
  std::string stranger = keys.Create("Stranger <s@test.invalid>");
  TestPackage signed_app;
  std::string text;
  for (int i = 0; i < 500; ++i) text += std::to_string(i * 7919) + " ";
  signed_app.files = {{"text.txt", text}};  // a payload big enough to tamper with
  std::string file = signed_app.Build(dir_);
  keys.Sign(file, stranger);
  Trust(0);
  CgiAnswer up = Upload(file);
  ASSERT_TRUE(up.Success()) << up.body;
  EXPECT_EQ(4533, up.Data()["codesign_error"].asInt());
  CgiAnswer strict = Call("install", {{"task_id", up.Data()["task_id"].asString()}});
  EXPECT_EQ(4533, strict.Code());
  EXPECT_FALSE(PackageRegistry::IsInstalled("test-app"));
  // The failed install leaves its tasks finished for the status call.
  NVX::TaskMgr mgr("@administrators");
  std::unique_ptr<NVX::Task> task(GetTaskWithTaskMgr(mgr, "@KIVOPKG_DOWNLOAD_test-app"));
  ASSERT_TRUE(task);
  EXPECT_TRUE(task->isFinished());

  // The trust level binds: at "trusted publishers only" not even the
  // administrator's confirmation installs an unsigned package or a stranger's.
  TestPackage unsigned_app;
  unsigned_app.id = "unsigned";
  const std::string unsigned_file = unsigned_app.Build(dir_);
  auto confirmed_install = [&](const std::string& path, int codesign_error) {
    CgiAnswer up = Upload(path);
    EXPECT_EQ(codesign_error, up.Data()["codesign_error"].asInt()) << up.body;
    return Call("install",
                {{"task_id", up.Data()["task_id"].asString()}, {"check_codesign", "false"}});
  };
  EXPECT_EQ(4531, confirmed_install(unsigned_file, 4531).Code());
  EXPECT_EQ(4533, confirmed_install(file, 4533).Code());
  EXPECT_FALSE(PackageRegistry::IsInstalled("unsigned"));
  EXPECT_FALSE(PackageRegistry::IsInstalled("test-app"));

  // A tampered file is refused at every level, confirmed or not.
  std::string tampered_file = dir_ + "/tampered.kpk";
  std::string data;
  ASSERT_TRUE(KIVOReadFile(file, &data));
  data[data.find("\x1f\x8b\x08", data.find("package.tgz")) + 30] ^= 0x40;
  ASSERT_TRUE(KIVOWriteFileAtomic(tampered_file, data, SyncToDisk::No));
  Trust(2);
  EXPECT_EQ(4532, confirmed_install(tampered_file, 4532).Code());
  EXPECT_FALSE(PackageRegistry::IsInstalled("test-app"));

  // A level that only warns (unsigned packages accepted) lets the
  // confirmation through for a stranger's signature.
  Trust(1);
  CgiAnswer lenient = confirmed_install(file, 4533);
  EXPECT_TRUE(lenient.Success()) << lenient.body;
  EXPECT_TRUE(PackageRegistry::IsInstalled("test-app"));
}

TEST_F(InstallFlowTest, EnvironmentCheckVersionsServicesAndLock) {
  root_.Write("/etc/kivo/services.conf", "pgsql=\"stopped\"\nweb=\"stopped\"\nssh=\"running\"\n");
  CgiAnswer v1 = Call("check", {{"depsers", "web:ssh:pgsql"}}, 1);
  EXPECT_EQ(4525, v1.Code());
  EXPECT_EQ(0x3u, v1.Errors()["services"].asUInt());   // pgsql and web bits
  EXPECT_FALSE(v1.Errors().isMember("volume_count"));  // the pgsql case drops the volume list
  CgiAnswer v2 = Call("check", {{"depsers", "web:ssh"}}, 2);
  EXPECT_EQ(4525, v2.Code());
  EXPECT_EQ("web", v2.Errors()["services"][0].asString());
  EXPECT_TRUE(v2.Errors().isMember("volume_count"));

  TestPackage base;
  base.id = "base";
  ASSERT_EQ(0, Kivoctl({"install", base.Build(dir_), "--run"}));
  // Version 1 tests conflicts with the version "1" whatever "ver" says.
  CgiAnswer conflict =
      Call("check",
           {{"id", "new"},
            {"conflictpkgs", "{\"base\": {\"operator\": \">=\", \"version\": \"1\"}}"},
            {"ver", "5"}},
           1);
  EXPECT_EQ(4524, conflict.Code());
  EXPECT_EQ("base", conflict.Errors()["packages"].asString());
  CgiAnswer deps = Call("check", {{"deppkgs", "{\"base\": {}, \"absent\": {}}"}}, 2);
  EXPECT_EQ(4526, deps.Code());
  EXPECT_EQ("absent", deps.Errors()["uninstall_packages"][0].asString());

  TestPackage user;
  user.id = "user";
  user.info = {{"displayname", "User App"}, {"install_dep_packages", "base"}};
  ASSERT_EQ(0, Kivoctl({"install", user.Build(dir_), "--run"}));
  CgiAnswer dependents = Call("check", {{"id", "base"}}, 2);
  EXPECT_EQ(4552, dependents.Code());
  EXPECT_EQ("User App", dependents.Errors()["packages"].asString());
  EXPECT_TRUE(Call("check", {{"id", "base"}, {"blCheckDep", "false"}}, 2).Success());

  root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"1\"\npkg_def_volume=\"/volume1\"\n");
  int lock = PMSLockFile(root_.Path("/run/kivo/pkgtool/lock"), 1);
  CgiAnswer busy = Call("check", {{"id", "new"}}, 2);
  ASSERT_TRUE(busy.Success()) << busy.body;
  EXPECT_TRUE(busy.Data()["is_occupied"].asBool());
  EXPECT_EQ("/volume1", busy.Data()["volume_path"].asString());
  PMSUnlockFile(lock);
}

TEST_F(InstallFlowTest, StatusAndCancelOfJobs) {
  EXPECT_TRUE(Call("status", {{"task_id", "@KIVOPKG_DOWNLOAD_none"}}).Data()["finished"].asBool());
  EXPECT_TRUE(Call("cancel", {{"taskid", "@KIVOPKG_DOWNLOAD_none"}}).Success());

  auto make_task = [](const std::string& id, const Json::Value& data, double progress) {
    std::unique_ptr<NVX::Task> task(GetNewTask("@administrators", id.c_str()));
    ASSERT_TRUE(task->setProperty("data", data));
    ASSERT_TRUE(task->setProperty("progress", progress));
  };
  // A download whose worker lives: cancel stops it and drops its folder.
  std::string folder = root_.Path("/volume1/@tmp/download-x");
  ASSERT_EQ(0, KIVOFSMkdirP(folder.c_str()));
  Json::Value job(Json::objectValue);
  job["pid"] = Spawn({"sleep", "60"});
  job["tmp_folder"] = folder;
  make_task("@KIVOPKG_DOWNLOAD_x", job, 0.5);
  EXPECT_DOUBLE_EQ(
      0.5, Call("status", {{"task_id", "@KIVOPKG_DOWNLOAD_x"}}).Data()["progress"].asDouble());
  ASSERT_TRUE(Call("cancel", {{"taskid", "@KIVOPKG_DOWNLOAD_x"}}).Success());
  EXPECT_EQ(0, KLIBCProcAlive(job["pid"].asInt()));  // ended (a zombie until this test reaps it)
  EXPECT_FALSE(KLIBCFileExist(folder.c_str()));
  EXPECT_FALSE(NVX::TaskMgr("@administrators").hasTask("@KIVOPKG_DOWNLOAD_x"));

  // Progress 1.0 counts only with the downloaded file; a negative one ends the job.
  job["pid"] = Spawn({"sleep", "60"});
  ASSERT_EQ(0, KIVOFSMkdirP(folder.c_str()));
  make_task("@KIVOPKG_DOWNLOAD_y", job, 1.0);
  EXPECT_DOUBLE_EQ(
      0.0, Call("status", {{"task_id", "@KIVOPKG_DOWNLOAD_y"}}).Data()["progress"].asDouble());
  root_.Write(folder.substr(root_.dir().size()) + "/@KIVOPKG_DOWNLOAD_y", "payload");
  EXPECT_DOUBLE_EQ(
      1.0, Call("status", {{"task_id", "@KIVOPKG_DOWNLOAD_y"}}).Data()["progress"].asDouble());
  // The worker writes its failure with the negative progress and finishes
  // the task after: a read in between is the last one, and it ends the job.
  Json::Value failed = job;
  failed["error"]["code"] = 2;
  failed["error"]["message"] = "the server answered HTTP 404";
  make_task("@KIVOPKG_DOWNLOAD_y", failed, -1.0);
  CgiAnswer last = Call("status", {{"task_id", "@KIVOPKG_DOWNLOAD_y"}});
  EXPECT_DOUBLE_EQ(0.0, last.Data()["progress"].asDouble());
  EXPECT_TRUE(last.Data()["finished"].asBool()) << last.body;
  EXPECT_EQ(2, last.Data()["error"]["code"].asInt()) << last.body;
  EXPECT_FALSE(NVX::TaskMgr("@administrators").hasTask("@KIVOPKG_DOWNLOAD_y"));
  EXPECT_FALSE(KLIBCFileExist(folder.c_str()));

  // An install under way is not cancelled, and its task is dropped all the same.
  Json::Value install(Json::objectValue);
  install["pid"] = Spawn({"sleep", "60"});
  install["installing"] = true;
  make_task("@KIVOPKG_DOWNLOAD_z", install, 0.0);
  EXPECT_EQ(4506, Call("cancel", {{"taskid", "@KIVOPKG_DOWNLOAD_z"}}).Code());
  EXPECT_EQ(1, KLIBCProcAlive(install["pid"].asInt()));
  EXPECT_FALSE(NVX::TaskMgr("@administrators").hasTask("@KIVOPKG_DOWNLOAD_z"));

  // A dead worker: cancel answers success; no pid at all: 4501.
  job["pid"] = 999999;
  make_task("@KIVOPKG_DOWNLOAD_dead", job, 0.2);
  EXPECT_TRUE(Call("cancel", {{"taskid", "@KIVOPKG_DOWNLOAD_dead"}}).Success());
  job.removeMember("pid");
  make_task("@KIVOPKG_DOWNLOAD_nopid", job, 0.2);
  EXPECT_EQ(4501, Call("cancel", {{"taskid", "@KIVOPKG_DOWNLOAD_nopid"}}).Code());
}

TEST_F(InstallFlowTest, CancelKillsAWorkerThatIgnoresSigterm) {
  Json::Value job(Json::objectValue);
  job["pid"] = Spawn({"sh", "-c", "trap '' TERM; while :; do sleep 0.1; done"});
  usleep(200000);  // let the shell set its trap
  std::unique_ptr<NVX::Task> task(GetNewTask("@administrators", "@KIVOPKG_DOWNLOAD_stubborn"));
  ASSERT_TRUE(task->setProperty("data", job));
  time_t start = time(nullptr);
  ASSERT_TRUE(Call("cancel", {{"taskid", "@KIVOPKG_DOWNLOAD_stubborn"}}).Success());
  EXPECT_GE(time(nullptr) - start, 9);  // ten one-second waits before SIGKILL
  int status = 0;
  EXPECT_EQ(job["pid"].asInt(), waitpid(job["pid"].asInt(), &status, 0));
  EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL);
}

TEST_F(InstallFlowTest, CleanAndGuardedDelete) {
  TestPackage app;
  CgiAnswer up = Upload(app.Build(dir_));
  ASSERT_TRUE(up.Success()) << up.body;
  ASSERT_EQ(1, Uploads());
  ASSERT_TRUE(Call("clean", {{"task_id", up.Data()["task_id"].asString()}}).Success());
  for (int i = 0; i < 100 && Uploads() > 0; ++i) usleep(20000);
  EXPECT_EQ(0, Uploads());
  for (int i = 0;
       i < 100 && NVX::TaskMgr("@administrators").hasTask(up.Data()["task_id"].asString()); ++i)
    usleep(20000);
  EXPECT_FALSE(NVX::TaskMgr("@administrators").hasTask(up.Data()["task_id"].asString()));

  root_.Write("/etc/keep", "precious");
  root_.Write("/tmp/junk/file", "junk");
  root_.Write("/volume1/@tmp/old-download/file", "junk");
  ASSERT_EQ(0, symlink(root_.Path("/etc").c_str(), root_.Path("/tmp/to-etc").c_str()));
  for (const std::string& hostile :
       {root_.Path("/tmp/../etc"), root_.Path("/tmp/../etc/keep"), root_.Path("/tmp/to-etc/keep"),
        root_.Path("/tmp"), root_.Path("/tmp/"), root_.Path("/volume1/@tmp"),
        root_.Path("/volume1/public/x"), std::string("/etc/passwd"),
        std::string("relative/path")}) {
    EXPECT_EQ(4501, Call("delete", {{"path", hostile}}).Code()) << hostile;
  }
  // A symlink inside the temporary folder goes, as a link; its target stays.
  EXPECT_TRUE(Call("delete", {{"path", root_.Path("/tmp/to-etc")}}).Success());
  ASSERT_TRUE(Call("delete", {{"path", root_.Path("/tmp/junk")}}).Success());
  ASSERT_TRUE(Call("delete", {{"path", root_.Path("/volume1/@tmp/old-download")}}).Success());
  for (int i = 0; i < 100 && (KLIBCFileExist(root_.Path("/tmp/junk").c_str()) ||
                              KLIBCFileExist(root_.Path("/volume1/@tmp/old-download").c_str()));
       ++i) {
    usleep(20000);
  }
  EXPECT_FALSE(KLIBCFileExist(root_.Path("/tmp/junk").c_str()));
  EXPECT_FALSE(KLIBCFileExist(root_.Path("/volume1/@tmp/old-download").c_str()));
  EXPECT_TRUE(KLIBCFileExist(root_.Path("/etc/keep").c_str()));
  EXPECT_TRUE(KLIBCFileExist(root_.Path("/etc/passwd").c_str()));
}

TEST_F(InstallFlowTest, InstallNamingAServerPackageStartsADownload) {
  CgiAnswer a =
      Call("install", {{"name", "demo"}, {"url", "http://127.0.0.1/x.kpk"}, {"filesize", "10"}});
  ASSERT_TRUE(a.Success()) << a.body;
  EXPECT_EQ("@KIVOPKG_DOWNLOAD_demo", a.Data()["taskid"].asString());
  EXPECT_EQ(4501, Call("install", {{"task_id", "@KIVOPKG_UPLOAD_nothing"}}).Code());
}

// The process that runs an install dies: "status" reads the job as failed,
// with a message, instead of "installing" forever.
TEST_F(InstallFlowTest, AnInstallWhoseProcessDiedReadsAsFailed) {
  TestPackage slow;
  slow.scripts = {{"preinst", "sleep 3\n"}};
  std::string file = slow.Build(dir_);
  pid_t installer = fork();
  if (installer == 0) _exit(client().Call(kInst, "install", 1, {{"path", file}}).Success() ? 0 : 1);
  Json::Value running =
      PollStatus("test-app", [](const Json::Value& d) { return d["pid"].isInt(); });
  ASSERT_TRUE(running["installing"].asBool()) << running.toStyledString();
  ASSERT_FALSE(running["finished"].asBool());
  ASSERT_EQ(0, kill(running["pid"].asInt(), SIGKILL));
  int exit_status = 0;
  waitpid(installer, &exit_status, 0);
  while (KLIBCProcAlive(running["pid"].asInt()) == 1) usleep(10000);
  for (int poll = 0; poll < 2; ++poll) {  // the outcome stays for later polls too
    CgiAnswer s = Call("status", {{"task_id", "@KIVOPKG_DOWNLOAD_test-app"}});
    ASSERT_TRUE(s.Success()) << s.body;
    EXPECT_TRUE(s.Data()["finished"].asBool()) << s.body;
    EXPECT_FALSE(s.Data()["installing"].asBool());
    EXPECT_EQ(4501, s.Data()["error"].asInt());
    EXPECT_NE(std::string::npos, s.Data()["message"].asString().find("ended")) << s.body;
  }
  // A new install claims the dead job's task.
  CgiAnswer again = Call("install", {{"path", file}});
  EXPECT_TRUE(again.Success()) << again.body;
}

// Worker messages are only what the package's scripts tell the user; which
// key signed the file comes in "signature" and in the operation's log.
TEST_F(InstallFlowTest, WorkerMessagesAreOnlyThePackagesOwn) {
  TestKeys keys(root_.Path("/tmp"));
  std::string publisher = keys.Create("Publisher <p@test.invalid>");
  keys.Trust(publisher);
  TestPackage silent;
  silent.id = "silent";
  std::string silent_file = silent.Build(dir_);
  keys.Sign(silent_file, publisher);
  CgiAnswer quiet = Call("install", {{"path", silent_file}});
  ASSERT_TRUE(quiet.Success()) << quiet.body;
  ASSERT_TRUE(quiet.Data()["worker_message"].isArray()) << quiet.body;
  EXPECT_EQ(0u, quiet.Data()["worker_message"].size()) << quiet.body;
  const std::string note = quiet.Data()["signature"].asString();
  EXPECT_EQ(0u, note.find("signed by key " + publisher)) << quiet.body;
  EXPECT_NE(std::string::npos, quiet.Data()["message"].asString().find("signature: " + note))
      << quiet.body;

  TestPackage talker;
  talker.id = "talker";
  talker.scripts = {{"postinst", "echo 'Open port 8080' >> \"$KIVO_WORKER_MSG\"\n"}};
  std::string talker_file = talker.Build(dir_);
  keys.Sign(talker_file, publisher);
  CgiAnswer told = Call("install", {{"path", talker_file}});
  ASSERT_TRUE(told.Success()) << told.body;
  ASSERT_EQ(1u, told.Data()["worker_message"].size()) << told.body;
  EXPECT_EQ("Open port 8080", told.Data()["worker_message"][0].asString());
}

// A failed install keeps the record it was started with: both tasks are
// finished with false and the install task's data still says installing,
// so "cancel" refuses it (4506) and drops it all the same.
TEST_F(InstallFlowTest, AFailedInstallStillSaysItWasInstalling) {
  CgiAnswer up = UploadWithPreinst("exit 1\n");
  ASSERT_TRUE(up.Success()) << up.body;
  const std::string upload_task = up.Data()["task_id"].asString();
  CgiAnswer install = Call("install", {{"task_id", upload_task}});
  ASSERT_EQ(4549, install.Code()) << install.body;
  NVX::TaskMgr mgr("@administrators");
  std::unique_ptr<NVX::Task> upload(GetTaskWithTaskMgr(mgr, upload_task));
  ASSERT_TRUE(upload);
  EXPECT_TRUE(upload->isFinished());
  EXPECT_EQ(up.Data()["id"], upload->getProperty("data")["id"]);
  std::unique_ptr<NVX::Task> task(GetTaskWithTaskMgr(mgr, "@KIVOPKG_DOWNLOAD_test-app"));
  ASSERT_TRUE(task);
  EXPECT_TRUE(task->isFinished());
  const Json::Value data = task->getProperty("data");
  EXPECT_TRUE(data["installing"].asBool()) << data.toStyledString();
  EXPECT_EQ("installing", data["status"].asString()) << data.toStyledString();
  EXPECT_FALSE(data.isMember("error")) << data.toStyledString();

  CgiAnswer status = Call("status", {{"task_id", "@KIVOPKG_DOWNLOAD_test-app"}});
  ASSERT_TRUE(status.Success()) << status.body;
  EXPECT_TRUE(status.Data()["finished"].asBool()) << status.body;
  EXPECT_TRUE(status.Data()["installing"].asBool()) << status.body;

  EXPECT_EQ(4506, Call("cancel", {{"taskid", "@KIVOPKG_DOWNLOAD_test-app"}}).Code());
  EXPECT_FALSE(mgr.hasTask("@KIVOPKG_DOWNLOAD_test-app"));
}

// Two installs of one package at once: the second is refused as busy and
// leaves the first one's task exactly as it was.
TEST_F(InstallFlowTest, ConcurrentInstallsOfOnePackageKeepTheFirstOnesTask) {
  CgiAnswer up = UploadWithPreinst("sleep 2\n");
  ASSERT_TRUE(up.Success()) << up.body;
  const std::string upload_task = up.Data()["task_id"].asString();
  pid_t first = fork();
  if (first == 0) {
    _exit(client().Call(kInst, "install", 1, {{"task_id", upload_task}}).Success() ? 0 : 1);
  }
  Json::Value before =
      PollStatus("test-app", [](const Json::Value& d) { return d["pid"].isInt(); });
  ASSERT_TRUE(before["pid"].isInt()) << before.toStyledString();
  CgiAnswer second = Call("install", {{"task_id", upload_task}});  // a double click
  EXPECT_EQ(4530, second.Code()) << second.body;
  EXPECT_NE(std::string::npos, second.Errors()["message"].asString().find("under way"));
  Json::Value during = Call("status", {{"task_id", "@KIVOPKG_DOWNLOAD_test-app"}}).Data();
  EXPECT_EQ(before["pid"].asInt(), during["pid"].asInt());
  EXPECT_FALSE(during["finished"].asBool());
  EXPECT_TRUE(during["installing"].asBool());
  int exit_status = 0;
  waitpid(first, &exit_status, 0);
  EXPECT_EQ(0, WEXITSTATUS(exit_status));
  EXPECT_TRUE(PackageRegistry::IsInstalled("test-app"));
  EXPECT_FALSE(NVX::TaskMgr("@administrators").hasTask(upload_task));
}

// A multipart body is taken whole or not at all.
TEST_F(InstallFlowTest, UploadBodiesMustBeWholeWithOneFile) {
  TestPackage app;
  std::string content;
  ASSERT_TRUE(KIVOReadFile(app.Build(dir_), &content));
  std::string type;
  const std::string good = MultipartBody({}, "app.kpk", content, &type);
  const std::string boundary = type.substr(type.find('=') + 1);
  const std::string closing = "\r\n--" + boundary + "--\r\n";
  ASSERT_EQ(good.size() - closing.size(), good.rfind(closing));
  const std::string head = good.substr(0, good.size() - closing.size());
  const std::string file_part = good.substr(good.find("--" + boundary));
  const std::string second_file = head + "\r\n" + file_part;
  const std::string reserved = head + "\r\n--" + boundary +
                               "\r\nContent-Disposition: form-data; name=\"file_tmp\"\r\n\r\n" +
                               root_.Path("/etc/passwd") + closing;
  for (const std::string& body : {head, head + "\r\nstray bytes", second_file, reserved}) {
    CgiAnswer a = PostBody(body, boundary);
    EXPECT_EQ(108, a.Code()) << a.body;
    EXPECT_EQ(0, Uploads());
  }
  EXPECT_TRUE(KLIBCFileExist(root_.Path("/etc/passwd").c_str()));
  const std::string nul_field = "--" + boundary +
                                "\r\nContent-Disposition: form-data; name=\"additional\"\r\n\r\n" +
                                std::string("[\"status\"]\0x", 12) + "\r\n" + good;
  EXPECT_EQ(101, PostBody(nul_field, boundary).Code());
  CgiAnswer whole = PostBody(good, boundary);
  ASSERT_TRUE(whole.Success()) << whole.body;
  EXPECT_EQ(1, Uploads());
}

// "check" and "upload" agree when the upload area of the volume is unusable.
TEST_F(InstallFlowTest, CheckAndUploadAgreeOnAnUnusableTemporaryFolder) {
  TestPackage app;
  std::string file = app.Build(dir_);
  root_.Write("/volume1/@tmp/upload", "a file where the folder should be");
  EXPECT_EQ(4503, Call("check", {{"id", "test-app"}, {"size", "1000"}}, 2).Code());
  EXPECT_EQ(4503, Upload(file).Code());
  unlink(root_.Path("/volume1/@tmp/upload").c_str());
  EXPECT_TRUE(Call("check", {{"id", "test-app"}, {"size", "1000"}}, 2).Success());
  EXPECT_TRUE(Upload(file).Success());
}

// A task write that fails is never answered as a task id.
TEST_F(InstallFlowTest, AnUploadWhoseTaskCannotBeWrittenIsRefused) {
  TestPackage app;
  std::string file = app.Build(dir_);
  ASSERT_TRUE(Upload(file).Success());  // makes the task store
  TaskStoreSql(
      "CREATE TRIGGER full BEFORE INSERT ON properties BEGIN SELECT RAISE(FAIL, 'disk full'); "
      "END;");
  CgiAnswer refused = Upload(file);
  EXPECT_EQ(4501, refused.Code()) << refused.body;
  EXPECT_EQ(1, Uploads());  // the first upload's file only
  NVX::TaskMgr mgr("@administrators");
  for (const std::string& id : mgr.listTasks("@KIVOPKG_UPLOAD_")) {
    std::unique_ptr<NVX::Task> task(mgr.getTask(id));
    EXPECT_TRUE(task->getProperty("data").isObject()) << id;  // no task without its data
  }
  // The install task cannot be claimed either: refused before the install.
  CgiAnswer install = Call("install", {{"path", file}});
  EXPECT_EQ(4501, install.Code()) << install.body;
  EXPECT_FALSE(PackageRegistry::IsInstalled("test-app"));
  TaskStoreSql("DROP TRIGGER full;");
}

// Any member changed after signing is a bad signature (4532), answered one
// way for the payload, INFO and a script alike: the upload goes on with the
// package described and "codesign_error" 4532 for the wizard to warn, and
// the install refuses the file, strict or confirmed.
TEST_F(InstallFlowTest, TamperedMembersAnswerAsABadSignature) {
  TestKeys keys(root_.Path("/tmp"));
  std::string publisher = keys.Create("Publisher <p@test.invalid>");
  keys.Trust(publisher);
  TestPackage app;
  app.info = {{"displayname", "Tamper Check"}};
  app.scripts = {{"postinst", "echo original-script\n"}};
  std::string text;
  for (int i = 0; i < 500; ++i) text += std::to_string(i * 7919) + " ";
  app.files = {{"text.txt", text}};
  std::string file = app.Build(dir_);
  keys.Sign(file, publisher);
  Trust(0);
  CgiAnswer clean = Upload(file);
  ASSERT_TRUE(clean.Success()) << clean.body;
  EXPECT_FALSE(clean.Data().isMember("codesign_error")) << clean.body;
  std::string data;
  ASSERT_TRUE(KIVOReadFile(file, &data));
  struct Tamper {
    const char* what;
    size_t at;
  } tampers[] = {
      {"INFO", data.find("Tamper Check") + 7},
      {"script", data.find("original-script") + 3},
      {"payload", data.find("\x1f\x8b\x08", data.find("package.tgz")) + 30},
  };
  for (const Tamper& t : tampers) {
    std::string changed = data;
    changed[t.at] ^= 0x01;
    std::string path = dir_ + "/tampered-" + t.what + ".kpk";
    ASSERT_TRUE(KIVOWriteFileAtomic(path, changed, SyncToDisk::No));
    CgiAnswer up = Upload(path);
    ASSERT_TRUE(up.Success()) << t.what << ": " << up.body;
    EXPECT_EQ(4532, up.Data()["codesign_error"].asInt()) << t.what << ": " << up.body;
    EXPECT_EQ("test-app", up.Data()["id"].asString()) << t.what << ": " << up.body;
    const std::string upload_task = up.Data()["task_id"].asString();
    CgiAnswer strict = Call("install", {{"task_id", upload_task}});
    EXPECT_EQ(4532, strict.Code()) << t.what << ": " << strict.body;
    CgiAnswer confirmed = Call("install", {{"task_id", upload_task}, {"check_codesign", "false"}});
    EXPECT_EQ(4532, confirmed.Code()) << t.what << ": " << confirmed.body;
    CgiAnswer by_path = Call("install", {{"path", path}});
    EXPECT_EQ(4532, by_path.Code()) << t.what << ": " << by_path.body;
    EXPECT_FALSE(PackageRegistry::IsInstalled("test-app")) << t.what;
  }
}

}  // namespace
