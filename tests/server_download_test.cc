// Downloading and installing from a package server through the real host:
// a worker process per download, progress polled through "status", the
// quick install, a second request while one runs, cancel, checksums, a
// server that drops the connection or sends too much, and the download
// check.

#include <dirent.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/process.h"
#include "pkgtool/registry.h"
#include "taskmgr/task.h"
#include "testing/admin_api_test.h"
#include "testing/catalogue_feed.h"
#include "testing/cgi_client.h"
#include "testing/http_test_server.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

constexpr char kInst[] = "KIVO.Core.Package.Installation";
constexpr char kTask[] = "@KIVOPKG_DOWNLOAD_dl-app";

// Bytes that do not compress, so the package file is as large as its payload.
std::string Noise(size_t size) {
  std::string out(size, '\0');
  uint32_t x = 2463534242u;
  for (char& c : out) {
    x ^= x << 13, x ^= x >> 17, x ^= x << 5;
    c = static_cast<char>(x);
  }
  return out;
}

class ServerDownloadTest : public AdminApiTest {
 protected:
  void SetUp() override {
    Trust(1);
    root_.Write("/etc/kivo/pkgserver.conf",
                VendorConf(feed_.Url(), "download_stall_timeout=\"2\"\n"));
    TestPackage app;
    app.id = "dl-app";
    app.daemon = false;
    app.files = {{"data.bin", Noise(256 * 1024)}};
    ASSERT_TRUE(feed_.Offer(app));
  }
  void TearDown() override { StopInstalledPackages(); }
  CgiAnswer Call(const std::string& method, const Params& params) {
    return client().Call(kInst, method, 1, params);
  }
  CgiAnswer Status() { return Call("status", {{"task_id", kTask}}); }
  CgiAnswer WaitFinished() { return WaitTaskFinished(client(), kTask); }
  // Download folders left on the volume.
  int DownloadFolders() { return CountEntries(root_.Path("/volume1/@tmp"), "download-"); }
  // Serves the changed catalogue; the appliance keeps the one it has for a
  // while, so it is told to ask again at once.
  void Republish() {
    feed_.Publish();
    ASSERT_TRUE(client()
                    .Call("KIVO.Core.Package.Server", "list", 1, {{"blforcereload", "true"}})
                    .Success());
  }
  // Serves `body` as dl-app's file, announced by its size alone, and
  // installs it from the catalogue until the download is done.
  void DownloadInstead(const std::string& body) {
    HttpRoute route;
    route.body = body;
    feed_.SetFileRoute("dl-app", route);
    feed_.Entry("dl-app")["size"] = static_cast<Json::UInt64>(body.size());
    feed_.Entry("dl-app").removeMember("md5");
    feed_.Entry("dl-app").removeMember("sha256");
    Republish();
    ASSERT_TRUE(Call("install", {{"name", "dl-app"}}).Success());
    CgiAnswer done = WaitFinished();
    ASSERT_EQ(1.0, done.Data()["progress"].asDouble()) << done.body;
  }
  // The package file stops halfway until server_.Release().
  void HoldHalfway() {
    HttpRoute halfway;
    halfway.hold_after = feed_.FileBody("dl-app").size() / 2;
    feed_.SetFileRoute("dl-app", halfway);
  }

  HttpTestServer server_;
  CatalogueFeed feed_{server_, root_.Path("/feed"), "/feed"};
};

TEST_F(ServerDownloadTest, DownloadShowsProgressThenChecksAndInstalls) {
  HoldHalfway();  // until the test has seen the progress move
  CgiAnswer start = Call("install", {{"name", "dl-app"}});
  ASSERT_TRUE(start.Success()) << start.body;
  EXPECT_EQ(kTask, start.Data()["taskid"].asString());
  EXPECT_EQ("0.00001", start.Data()["progress"].asString());
  // The catalogue shows the running download.
  CgiAnswer list = client().Call("KIVO.Core.Package.Server", "list", 1);
  ASSERT_TRUE(list.Success()) << list.body;
  EXPECT_EQ("downloading", list.Data()["data"][0]["info"]["status"].asString());
  double moving = 0;
  for (int i = 0; i < 200 && moving == 0; ++i) {
    double p = Status().Data()["progress"].asDouble();
    if (p > 0 && p < 1.0) moving = p;
    usleep(50000);
  }
  EXPECT_GT(moving, 0.0);
  server_.Release();
  CgiAnswer done = WaitFinished();
  EXPECT_EQ(1.0, done.Data()["progress"].asDouble()) << done.body;
  EXPECT_EQ("downloaded", done.Data()["status"].asString());
  const std::string file = done.Data()["tmp_folder"].asString() + "/" + kTask;
  EXPECT_EQ(0, access(file.c_str(), F_OK));

  for (int i = 0; i < 2; ++i) {  // a successful check can be repeated
    CgiAnswer check =
        client().Call("KIVO.Core.Package.Installation.Download", "check", 1, {{"taskid", kTask}});
    ASSERT_TRUE(check.Success()) << check.body;
    EXPECT_EQ("dl-app", check.Data()["id"].asString());
    EXPECT_EQ("non_installed", check.Data()["status"].asString());
  }
  CgiAnswer install = Call("install", {{"path", file}});
  ASSERT_TRUE(install.Success()) << install.body;
  EXPECT_TRUE(PackageRegistry::IsInstalled("dl-app"));
}

TEST_F(ServerDownloadTest, QuickInstallEndsInTheListAndLeavesNoFile) {
  CgiAnswer start = Call("install", {{"name", "dl-app"}, {"blqinst", "true"}});
  ASSERT_TRUE(start.Success()) << start.body;
  CgiAnswer done = WaitFinished();
  EXPECT_TRUE(done.Data()["finished"].asBool()) << done.body;
  EXPECT_TRUE(PackageRegistry::IsInstalled("dl-app"));
  EXPECT_EQ(0, DownloadFolders());
  EXPECT_FALSE(NVX::TaskMgr("@administrators").hasTask(kTask));
  CgiAnswer list = client().Call("KIVO.Core.Package", "list", 1);
  EXPECT_EQ("dl-app", list.Data()["packages"][0]["id"].asString());
}

TEST_F(ServerDownloadTest, SecondRequestReportsTheRunningDownloadAndCancelCleansUp) {
  HoldHalfway();
  CgiAnswer first = Call("install", {{"name", "dl-app"}});
  ASSERT_TRUE(first.Success()) << first.body;
  CgiAnswer second = Call("install", {{"name", "dl-app"}});
  ASSERT_TRUE(second.Success()) << second.body;
  EXPECT_EQ(kTask, second.Data()["data"]["taskid"].asString());
  EXPECT_TRUE(second.Data().isMember("progress"));
  int pid = second.Data()["data"]["pid"].asInt();
  ASSERT_GT(pid, 0) << second.body;
  EXPECT_EQ(1, DownloadFolders());
  CgiAnswer cancel = Call("cancel", {{"taskid", kTask}});
  ASSERT_TRUE(cancel.Success()) << cancel.body;
  EXPECT_NE(1, KLIBCProcAlive(pid)) << cancel.body;
  EXPECT_EQ(0, DownloadFolders());
  EXPECT_FALSE(NVX::TaskMgr("@administrators").hasTask(kTask));
}

TEST_F(ServerDownloadTest, ChecksumMismatchAndOversizeFailInWordsAndLeaveNothing) {
  struct Case {
    const char* key;
    Json::Value value;
    int code;
    const char* says;
  };
  const Case kCases[] = {
      {"md5", "0123456789abcdef0123456789abcdef", 4, "md5"},
      {"sha256", std::string(64, 'a'), 4, "sha256"},
      {"size", 1000, 3, "more than"},
  };
  for (const Case& c : kCases) {
    Json::Value saved = feed_.Entry("dl-app");
    feed_.Entry("dl-app")[c.key] = c.value;
    Republish();
    ASSERT_TRUE(Call("install", {{"name", "dl-app"}}).Success());
    CgiAnswer s = WaitFinished();
    EXPECT_EQ(c.code, s.Data()["error"]["code"].asInt()) << c.key << ": " << s.body;
    EXPECT_NE(std::string::npos, s.Data()["error"]["message"].asString().find(c.says)) << s.body;
    EXPECT_EQ("failed", s.Data()["status"].asString());
    EXPECT_EQ(0, DownloadFolders()) << c.key;
    feed_.Entry("dl-app") = saved;
  }
}

TEST_F(ServerDownloadTest, DroppedConnectionResumesFromTheBytesOnDisk) {
  // Several of the digest threads' blocks, dropped inside the second one: the
  // bytes on disk and the resumed rest must make the catalogue's md5 and
  // sha256, or the install is refused.
  TestPackage big;
  big.id = "dl-app";
  big.daemon = false;
  big.files = {{"data.bin", Noise(3 * 1024 * 1024)}};
  feed_.Add(big);
  ASSERT_TRUE(feed_.Index());
  ASSERT_FALSE(feed_.Entry("dl-app")["sha256"].asString().empty());
  Republish();
  HttpRoute drop;
  drop.drop_after = 1536 * 1024;
  drop.drop_times = 1;
  feed_.SetFileRoute("dl-app", drop);
  ASSERT_TRUE(Call("install", {{"name", "dl-app"}, {"blqinst", "true"}}).Success());
  WaitFinished();
  EXPECT_TRUE(PackageRegistry::IsInstalled("dl-app"));
  const std::string path =
      "/feed/" + feed_.FilePath("dl-app").substr(feed_.FilePath("dl-app").rfind('/') + 1);
  EXPECT_EQ(2, server_.Requests(path));
  EXPECT_NE(std::string::npos, server_.LastHeaders(path).find("Range: bytes=1572864-"))
      << server_.LastHeaders(path);
}

TEST_F(ServerDownloadTest, DeadLinkAndClientLinkFailOrSucceedWithoutTheCatalogue) {
  HttpRoute gone;
  gone.status = 404;
  gone.body = "gone";
  feed_.SetFileRoute("dl-app", gone);
  ASSERT_TRUE(Call("install", {{"name", "dl-app"}}).Success());
  CgiAnswer s = WaitFinished();
  EXPECT_EQ(2, s.Data()["error"]["code"].asInt()) << s.body;
  EXPECT_NE(std::string::npos, s.Data()["error"]["message"].asString().find("404"));
  EXPECT_EQ(0, DownloadFolders());

  // A link of the client's own: the catalogue is not asked.
  HttpRoute direct;
  direct.body = feed_.FileBody("dl-app");
  server_.Set("/direct.kpk", direct);
  int asked = server_.Requests("/feed/catalogue.json");
  CgiAnswer start = Call("install", {{"name", "dl-app"},
                                     {"url", server_.Url("/direct.kpk")},
                                     {"filesize", std::to_string(feed_.FileBody("dl-app").size())},
                                     {"blqinst", "true"}});
  ASSERT_TRUE(start.Success()) << start.body;
  WaitFinished();
  EXPECT_TRUE(PackageRegistry::IsInstalled("dl-app"));
  EXPECT_EQ(asked, server_.Requests("/feed/catalogue.json"));

  CgiAnswer unknown = Call("install", {{"name", "no-such-app"}});
  EXPECT_EQ(4501, unknown.Code()) << unknown.body;
  CgiAnswer hostile = Call("install", {{"name", "../etc"}});
  EXPECT_EQ(4500, hostile.Code()) << hostile.body;
}

TEST_F(ServerDownloadTest, DownloadCheckRemovesWhatCannotBeInstalled) {
  const char kApi[] = "KIVO.Core.Package.Installation.Download";
  EXPECT_EQ(4501, client().Call(kApi, "check", 1, {{"taskid", "@KIVOPKG_DOWNLOAD_none"}}).Code());

  // Bytes that are not a package file, announced with their own checksums.
  DownloadInstead(Noise(5000));
  EXPECT_EQ(4521, client().Call(kApi, "check", 1, {{"taskid", kTask}}).Code());
  EXPECT_EQ(0, DownloadFolders());
  EXPECT_EQ(4501, client().Call(kApi, "check", 1, {{"taskid", kTask}}).Code());

  // A finished download whose folder was cleaned meanwhile.
  std::unique_ptr<NVX::Task> task(GetNewTask("@administrators", kTask));
  Json::Value data(Json::objectValue);
  data["tmp_folder"] = root_.Path("/volume1/@tmp/download-dl-app-gone");
  ASSERT_TRUE(task->setProperty("data", data));
  EXPECT_EQ(4501, client().Call(kApi, "check", 1, {{"taskid", kTask}}).Code());
  EXPECT_FALSE(NVX::TaskMgr("@administrators").hasTask(kTask));
}

// A downloaded file with a member changed after it was built is inspected
// like an upload: a bad signature for the wizard to warn about (and the
// install to refuse), not an unreadable file, whichever member it is.
TEST_F(ServerDownloadTest, DownloadCheckAnswersAChangedMemberAsABadSignature) {
  const char kApi[] = "KIVO.Core.Package.Installation.Download";
  std::string changed = feed_.FileBody("dl-app");
  const size_t version = changed.find("version=\"1.0\"");
  ASSERT_NE(std::string::npos, version);
  changed[version + 9] = '2';  // INFO now says 2.0; MANIFEST still names 1.0's digest
  DownloadInstead(changed);
  CgiAnswer check = client().Call(kApi, "check", 1, {{"taskid", kTask}});
  ASSERT_TRUE(check.Success()) << check.body;
  EXPECT_EQ(4532, check.Data()["codesign_error"].asInt()) << check.body;
  EXPECT_EQ(1, DownloadFolders());  // kept for the install, which refuses it
}

}  // namespace
