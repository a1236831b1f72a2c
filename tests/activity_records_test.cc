// The activity log beyond one request's own answer, through the real host,
// the real kivoctl and a loopback package server: a server install is on
// record with how its download and install ended (or that its worker never
// finished), kivoctl's drop-revision is on record, operations running at
// once all land in the order they began, and a log that cannot be written
// (locked, not a file, damaged) never stands in an operation's way.

#include <chrono>
#include <csignal>
#include <filesystem>
#include <set>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include <gtest/gtest.h>

#include "activity/activity_log.h"
#include "klibc/json_text.h"
#include "pkgtool/registry.h"
#include "taskmgr/sqlite_api.h"
#include "taskmgr/task.h"
#include "testing/admin_api_test.h"
#include "testing/catalogue_feed.h"
#include "testing/cgi_client.h"
#include "testing/http_test_server.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

constexpr char kActivity[] = "KIVO.Core.Package.Activity";
constexpr char kInstallation[] = "KIVO.Core.Package.Installation";
constexpr char kControl[] = "KIVO.Core.Package.Control";
constexpr char kTask[] = "@KIVOPKG_DOWNLOAD_dl-app";

class ActivityRecordsTest : public AdminApiTest {
 protected:
  void SetUp() override {
    Trust(1);
    root_.Write("/etc/kivo/pkgserver.conf", VendorConf(feed_.Url(), ""));
    TestPackage app;
    app.id = "dl-app";
    app.daemon = false;
    ASSERT_TRUE(feed_.Offer(app));
  }
  void TearDown() override { StopInstalledPackages(); }

  // A package file of `id` whose start runs `start` (a shell line) first;
  // it runs while its marker file is there.
  std::string Package(const std::string& id, const std::string& start = "true") {
    TestPackage p;
    p.id = id;
    p.daemon = false;
    p.scripts = {{"start-stop-status",
                  "on=\"$KIVO_PKG_VAR/on\"\n"
                  "case \"$1\" in\n"
                  "start) " +
                      start +
                      "; touch \"$on\";;\n"
                      "stop) rm -f \"$on\";;\n"
                      "status) [ -f \"$on\" ];;\n"
                      "esac\n"}};
    return p.Build(root_.Path("/tmp/packages"));
  }
  CgiAnswer List(const Params& params) { return client().Call(kActivity, "list", 1, params); }
  // The entries of `operation`, newest first.
  Json::Value Entries(const std::string& operation) {
    CgiAnswer a = List({{"operation", operation}});
    EXPECT_TRUE(a.Success()) << a.body;
    return a.Data()["entries"];
  }
  // The newest entry of `operation` once it is no longer running (its
  // process may end it a moment after the task says it is done); null when
  // there is none.
  Json::Value Ended(const std::string& operation) {
    for (int i = 0; i < 200; ++i) {
      Json::Value e = Entries(operation)[0];
      if (e.isNull() || e["state"].asString() != "running") return e;
      usleep(50000);
    }
    return Entries(operation)[0];
  }
  // Holds the log's write lock from this process until ReleaseLog, as a
  // stuck writer would.
  void HoldLog() {
    ASSERT_EQ(SQLITE_OK, NVX::Sqlite()->open_v2(KivoActivity::ActivityLog::Path().c_str(), &held_,
                                                SQLITE_OPEN_READWRITE, nullptr));
    ASSERT_EQ(SQLITE_OK, NVX::Sqlite()->exec(held_, "BEGIN EXCLUSIVE", nullptr, nullptr, nullptr));
  }
  void ReleaseLog() {
    if (!held_) return;
    NVX::Sqlite()->exec(held_, "ROLLBACK", nullptr, nullptr, nullptr);
    NVX::Sqlite()->close(held_);
    held_ = nullptr;
  }

  HttpTestServer server_;
  CatalogueFeed feed_{server_, root_.Path("/feed"), "/feed"};
  sqlite3* held_ = nullptr;
};

TEST_F(ActivityRecordsTest, AServerInstallEndsWithTheOutcomeOfItsDownloadAndInstall) {
  ASSERT_TRUE(client()
                  .Call(kInstallation, "install", 1, {{"name", "dl-app"}, {"blqinst", "true"}})
                  .Success());
  ASSERT_TRUE(WaitTaskFinished(client(), kTask).Data()["finished"].asBool());
  ASSERT_TRUE(PackageRegistry::IsInstalled("dl-app"));
  Json::Value e = Ended("Installation.install");
  EXPECT_EQ("success", e["state"].asString()) << e;
  EXPECT_EQ("installed", e["words"].asString()) << e;
  EXPECT_EQ("admin", e["actor"].asString());
  EXPECT_EQ("dl-app", e["packages"][0].asString());
  EXPECT_EQ(1u, Entries("Installation.install").size());

  // A download that fails: the entry says why, not that the request was
  // taken.
  HttpRoute gone;
  gone.status = 404;
  gone.body = "gone";
  feed_.SetFileRoute("dl-app", gone);
  ASSERT_TRUE(client()
                  .Call(kInstallation, "install", 1, {{"name", "dl-app"}, {"blqinst", "true"}})
                  .Success());
  WaitTaskFinished(client(), kTask);
  e = Ended("Installation.install");
  EXPECT_EQ("failure", e["state"].asString()) << e;
  EXPECT_EQ(2, e["code"].asInt()) << e;  // the server answered with an error status
  EXPECT_NE(std::string::npos, e["words"].asString().find("404")) << e;
  EXPECT_FALSE(e["ended"].isNull());
}

TEST_F(ActivityRecordsTest, AServerInstallWhoseWorkerIsKilledShowsItNeverFinished) {
  HttpRoute halfway;
  halfway.hold_after = feed_.FileBody("dl-app").size() / 2;
  feed_.SetFileRoute("dl-app", halfway);
  ASSERT_TRUE(client()
                  .Call(kInstallation, "install", 1, {{"name", "dl-app"}, {"blqinst", "true"}})
                  .Success());
  // The worker is at work (the request has answered) and the entry is its.
  int worker = 0;
  for (int i = 0; i < 200 && worker == 0; ++i) {
    Json::Value data = client().Call(kInstallation, "status", 1, {{"task_id", kTask}}).Data();
    if (data["progress"].asDouble() > 0 && data["pid"].isInt()) worker = data["pid"].asInt();
    usleep(50000);
  }
  ASSERT_GT(worker, 0);
  EXPECT_EQ("running", Entries("Installation.install")[0]["state"].asString());
  ASSERT_EQ(0, kill(worker, SIGKILL));
  for (int i = 0; i < 200 && kill(worker, 0) == 0; ++i) usleep(25000);
  server_.Release();
  Json::Value e = Entries("Installation.install")[0];
  EXPECT_EQ("unfinished", e["state"].asString()) << e;
  EXPECT_TRUE(e["ended"].isNull());
}

TEST_F(ActivityRecordsTest, KivoctlDropRevisionIsOnRecord) {
  std::string out;
  ASSERT_EQ(0, Kivoctl({"install", Package("alpha")}, &out)) << out;
  int status = Kivoctl({"drop-revision", "alpha"}, &out);
  Json::Value e = Entries("Revision.drop")[0];
  EXPECT_EQ("kivoctl", e["origin"].asString()) << e;
  EXPECT_EQ("alpha", e["packages"][0].asString()) << e;
  EXPECT_EQ(status, e["code"].asInt()) << e;
  EXPECT_FALSE(e["ended"].isNull());
}

TEST_F(ActivityRecordsTest, OperationsAtOnceAllLandInTheOrderTheyBegan) {
  ASSERT_TRUE(client().signed_in());  // the administrator's sign-in is on record first
  std::string out;
  // alpha's start waits for the test's word, so that the other calls run
  // while it does.
  ASSERT_EQ(
      0, Kivoctl({"install", Package("alpha",
                                     "touch \"$KIVO_PKG_VAR/started\"; "
                                     "while [ ! -f \"$KIVO_PKG_VAR/go\" ]; do sleep 0.05; done")},
                 &out))
      << out;
  const std::string started = root_.Path("/var/packages/alpha/var/started");
  const std::string go = "/var/packages/alpha/var/go";
  pid_t slow = fork();
  if (slow == 0) _exit(Kivoctl({"start", "alpha"}));
  for (int i = 0; i < 400 && access(started.c_str(), F_OK) != 0; ++i) usleep(25000);
  if (access(started.c_str(), F_OK) != 0) {
    root_.Write(go, "");
    waitpid(slow, nullptr, 0);
    FAIL() << "alpha's start did not begin";
  }
  // Six failed sign-ins at once beside it (none waits for the package
  // tool, which alpha's start holds).
  std::vector<pid_t> callers;
  for (int i = 1; i <= 6; ++i) {
    pid_t pid = fork();
    if (pid == 0) {
      std::string body = EncodeForm({{"api", "KIVO.API.Auth"},
                                     {"method", "login"},
                                     {"version", "1"},
                                     {"account", "user" + std::to_string(i)},
                                     {"passwd", "wrong"}});
      RunEntryCgi({{"REQUEST_METHOD", "POST"},
                   {"CONTENT_TYPE", "application/x-www-form-urlencoded"},
                   {"CONTENT_LENGTH", std::to_string(body.size())},
                   {"REMOTE_ADDR", "192.0.2.9"}},
                  body);
      _exit(0);
    }
    callers.push_back(pid);
  }
  for (pid_t pid : callers) waitpid(pid, nullptr, 0);
  root_.Write(go, "");
  int status = 0;
  ASSERT_EQ(slow, waitpid(slow, &status, 0));
  EXPECT_EQ(0, WEXITSTATUS(status));

  CgiAnswer all = List({});
  Json::Value entries = all.Data()["entries"];
  std::set<std::string> refused;
  Json::Value start;
  for (unsigned i = 0; i < entries.size(); ++i) {
    const Json::Value& e = entries[i];
    if (i > 0) {  // newest first: begun no later than the one listed before
      EXPECT_LT(e["id"].asInt64(), entries[i - 1]["id"].asInt64());
      EXPECT_LE(e["started"].asInt64(), entries[i - 1]["started"].asInt64());
    }
    EXPECT_NE("running", e["state"].asString()) << e;
    if (e["operation"].asString() == "sign-in failed") refused.insert(e["actor"].asString());
    if (e["operation"].asString() == "Control.start") start = e;
  }
  EXPECT_EQ(6u, refused.size()) << all.body;
  ASSERT_FALSE(start.isNull()) << all.body;
  EXPECT_EQ("success", start["state"].asString());
  // Begun before the calls, ended after them.
  EXPECT_EQ("Control.start", entries[entries.size() - 1 - 2]["operation"].asString()) << all.body;
  EXPECT_GE(start["ended"].asInt64(), entries[0]["ended"].asInt64());
}

TEST_F(ActivityRecordsTest, ALockedLogDelaysNoOperationLongAndStopsNone) {
  std::string out;
  ASSERT_EQ(0, Kivoctl({"install", Package("alpha")}, &out)) << out;  // the log exists
  HoldLog();
  const auto begun = std::chrono::steady_clock::now();
  EXPECT_EQ(0, Kivoctl({"install", Package("beta")}, &out)) << out;
  CgiAnswer start = client().Call(kControl, "start", 1, {{"id", "[\"beta\"]"}});
  const auto took = std::chrono::steady_clock::now() - begun;
  ReleaseLog();
  EXPECT_TRUE(start.Success()) << start.body;
  EXPECT_TRUE(PackageRegistry::IsInstalled("beta"));
  // Each waits for the lock a short while, once, then goes on unrecorded.
  EXPECT_LT(took, std::chrono::seconds(15));
  EXPECT_EQ(0u, Entries("Control.start").size());
}

TEST_F(ActivityRecordsTest, ALogThatIsNoFileOrDamagedStopsNoOperation) {
  std::string out;
  // Something else stands where the log would be: nothing is recorded.
  ASSERT_TRUE(std::filesystem::create_directories(root_.Path("/var/lib/kivo/activity.db")));
  EXPECT_EQ(0, Kivoctl({"install", Package("alpha")}, &out)) << out;
  EXPECT_TRUE(PackageRegistry::IsInstalled("alpha"));
  ASSERT_EQ(0, rmdir(root_.Path("/var/lib/kivo/activity.db").c_str()));

  // A damaged log is set aside and a fresh one records the operation.
  root_.Write("/var/lib/kivo/activity.db", std::string(8192, '\x5a'));
  CgiAnswer start = client().Call(kControl, "start", 1, {{"id", "[\"alpha\"]"}});
  EXPECT_TRUE(start.Success()) << start.body;
  EXPECT_EQ(1, CountEntries(root_.Path("/var/lib/kivo"), "activity.db.damaged-"));
  EXPECT_EQ("success", Entries("Control.start")[0]["state"].asString());
}

}  // namespace
