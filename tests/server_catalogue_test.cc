// The package servers' catalogue through the real host, against catalogues
// that kivoctl index built and a loopback server serves: merged with the
// installed state, array and object forms, feeds, malformed and misbehaving
// servers, caching with conditional requests, and the update badge.

#include <dirent.h>
#include <signal.h>
#include <sstream>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>
#include <json/reader.h>
#include <json/writer.h>

#include "klibc/atomic_file.h"
#include "klibc/sysroot.h"
#include "pkgtool/registry.h"
#include "taskmgr/task.h"
#include "testing/admin_api_test.h"
#include "testing/catalogue_feed.h"
#include "testing/cgi_client.h"
#include "testing/http_test_server.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"
#include "testing/web_server.h"

namespace {

constexpr char kServer[] = "KIVO.Core.Package.Server";

class ServerCatalogueTest : public AdminApiTest {
 protected:
  void SetUp() override {
    root_.Write("/etc/kivoinfo.conf",
                "pkg_source_trust_level=\"1\"\n"
                "package_update_channel=\"beta\"\n");
    Configure(feed_.Url());
  }
  void TearDown() override { StopInstalledPackages(); }
  void Configure(const std::string& vendor, const std::string& more = "") {
    root_.Write("/etc/kivo/pkgserver.conf", VendorConf(vendor,
                                                       "catalogue_timeout=\"2\"\n"
                                                       "catalogue_max_bytes=\"1048576\"\n" +
                                                           more));
  }
  CgiAnswer List(const Params& params = {}) { return client().Call(kServer, "list", 1, params); }

  HttpTestServer server_;
  CatalogueFeed feed_{server_, root_.Path("/feed"), "/feed"};
};

TEST_F(ServerCatalogueTest, MergesInstalledStateUpgradesTasksAndRecommendations) {
  TestPackage a;
  a.id = "app-a";
  a.info = {{"adminport", "8123"}, {"adminurl", "ui"}, {"adminprotocol", "https"}};
  // Version 1.0 installed from this server, which then offers 2.0.
  ASSERT_TRUE(feed_.Offer(a));
  std::string out;
  ASSERT_EQ(0, Kivoctl({"install-server", "app-a", "--run"}, &out)) << out;
  a.version = "2.0";
  feed_.Replace(a);
  TestPackage b;
  b.id = "app-b";
  b.info = {{"install_dep_packages", "app-a>=1.0"}, {"beta", "yes"}};
  feed_.Add(b);
  TestPackage c;
  c.id = "app-c";
  feed_.Add(c);
  ASSERT_TRUE(feed_.Index());
  feed_.catalogue()["packages"].append("not an entry");
  feed_.catalogue()["packages"].append(Json::Value(Json::objectValue));
  feed_.catalogue()["recommend"] = Json::Value(Json::arrayValue);
  for (const char* id : {"app-b", "gone", "app-a"}) feed_.catalogue()["recommend"].append(id);
  feed_.Publish();
  root_.Write("/usr/kivo/etc/packages/restricted", "app-c 1.0\n");
  // A finished download of app-b whose file has gone meanwhile.
  std::unique_ptr<NVX::Task> task(GetNewTask("@administrators", "@KIVOPKG_DOWNLOAD_app-b"));
  Json::Value data(Json::objectValue);
  data["tmp_folder"] = root_.Path("/volume1/@tmp/download-app-b-gone");
  data["pid"] = 0;
  ASSERT_TRUE(task->setProperty("data", data));
  ASSERT_TRUE(task->setProperty("progress", 1.0));

  CgiAnswer list = List({{"blforcereload", "true"}});
  ASSERT_TRUE(list.Success()) << list.body;
  EXPECT_EQ(2u, list.Data()["total"].asUInt());
  EXPECT_TRUE(list.Data()["blupgrade"].asBool());
  Json::Value ea = CatalogueEntry(list, "app-a"), eb = CatalogueEntry(list, "app-b");
  EXPECT_TRUE(ea["blupgrade"].asBool());
  EXPECT_EQ("kivo", ea["source"].asString());
  EXPECT_EQ("running", ea["status"].asString());
  ASSERT_EQ(1u, ea["url"].size()) << ea.toStyledString();
  EXPECT_EQ("https://nas.example:8123/ui", ea["url"][0].asString());
  // Reached over IPv6, the package's address keeps the bracketed host.
  const std::string body = EncodeForm(
      {{"api", kServer}, {"method", "list"}, {"version", "1"}, {"_sid", client().sid()}});
  CgiAnswer over_ipv6 = RunEntryCgi({{"REQUEST_METHOD", "POST"},
                                     {"CONTENT_TYPE", "application/x-www-form-urlencoded"},
                                     {"CONTENT_LENGTH", std::to_string(body.size())},
                                     {"HTTP_HOST", "[::1]:5000"}},
                                    body);
  ASSERT_TRUE(over_ipv6.Success()) << over_ipv6.body;
  EXPECT_EQ("https://[::1]:8123/ui", CatalogueEntry(over_ipv6, "app-a")["url"][0].asString());
  EXPECT_FALSE(eb["blupgrade"].asBool());
  EXPECT_FALSE(eb.isMember("status"));
  EXPECT_TRUE(eb["beta"].asBool());
  EXPECT_TRUE(eb["deppkgs"].isMember("app-a")) << eb["deppkgs"].toStyledString();
  EXPECT_EQ(0.0, eb["progress"].asDouble());  // 1.0 without its file
  EXPECT_TRUE(eb["info"].isObject());
  const Json::Value& rec = list.Data()["recommend"];
  ASSERT_EQ(2u, rec.size());
  EXPECT_EQ("app-b", rec[0]["id"].asString());
  EXPECT_EQ("app-a", rec[1]["id"].asString());
  // What the appliance is travels with the request.
  std::string query = server_.LastQuery("/feed/catalogue.json");
  EXPECT_NE(std::string::npos, query.find("language=")) << query;
  EXPECT_NE(std::string::npos, query.find("channel=beta")) << query;

  // The same version installed: no upgrade anywhere.
  feed_.Entry("app-a")["version"] = "1.0";
  feed_.Publish();
  list = List({{"blforcereload", "true"}});
  EXPECT_FALSE(CatalogueEntry(list, "app-a")["blupgrade"].asBool());
  EXPECT_FALSE(list.Data()["blupgrade"].asBool());

  EXPECT_TRUE(client().Call(kServer, "check", 1).Success());
  std::string badge;
  ASSERT_TRUE(KIVOReadFile(root_.Path("/var/cache/kivo/pkgserver/upgrade_badge.json"), &badge));
  EXPECT_NE(std::string::npos, badge.find("\"count\" : 0")) << badge;
}

// An install under way of a package the catalogue lists: the entry's "info"
// is the task's data as stored, with nothing added.
TEST_F(ServerCatalogueTest, InfoOfAnInstallUnderWayIsTheTasksData) {
  TestPackage listed;
  listed.id = "app-held";
  ASSERT_TRUE(feed_.Offer(listed));
  // The same package from a file, held in its preinst until the test lets go.
  TestPackage held = listed;
  held.scripts = {{"preinst",
                   "for i in $(seq 400); do [ -e \"$KIVO_ROOT/tmp/go\" ] && exit 0; "
                   "sleep 0.05; done\n"}};
  const std::string file = held.Build(root_.Path("/tmp/packages"));
  client();  // signed in before the fork, for both processes
  pid_t installer = fork();
  if (installer == 0) {
    _exit(client().Call("KIVO.Core.Package.Installation", "install", 1, {{"path", file}}).Success()
              ? 0
              : 1);
  }
  NVX::TaskMgr mgr("@administrators");
  auto stored = [&mgr] {
    std::unique_ptr<NVX::Task> task(mgr.getTask("@KIVOPKG_DOWNLOAD_app-held"));
    return task ? task->getProperty("data") : Json::Value();
  };
  Json::Value before;
  for (int i = 0; i < 500 && !before["installing"].asBool(); ++i) {
    usleep(20000);
    before = stored();
  }
  CgiAnswer list = List();
  const Json::Value after = stored();
  root_.Write("/tmp/go", "");
  int exit_status = 0;
  ASSERT_EQ(installer, waitpid(installer, &exit_status, 0));
  ASSERT_TRUE(before["installing"].asBool()) << before.toStyledString();
  ASSERT_EQ(before, after) << "the install moved on while the catalogue was read";
  ASSERT_TRUE(list.Success()) << list.body;
  EXPECT_EQ(before, CatalogueEntry(list, "app-held")["info"]) << list.body;
  EXPECT_EQ(0, WEXITSTATUS(exit_status));
}

TEST_F(ServerCatalogueTest, FeedsMergeArrayAndObjectFormsWithoutRecommendations) {
  TestPackage a;
  a.id = "feed-a";
  ASSERT_TRUE(feed_.Offer(a));
  HttpRoute array;
  array.body = "[{\"package\": \"feed-b\", \"version\": \"1.0\", \"link\": \"" +
               server_.Url("/b.kpk") + "\"}]";
  server_.Set("/array.json", array);
  root_.Write("/usr/kivo/etc/packages/feeds",
              "[{\"feed\": \"" + feed_.Url() + "\", \"name\": \"one\"}, {\"feed\": \"" +
                  server_.Url("/array.json") + "\"}, {\"feed\": \"" + server_.Url("/missing.json") +
                  "\"}]");
  CgiAnswer list = List({{"blloadothers", "true"}});
  ASSERT_TRUE(list.Success()) << list.body;
  EXPECT_EQ(2u, list.Data()["total"].asUInt());
  EXPECT_EQ("others", CatalogueEntry(list, "feed-b")["source"].asString());
  EXPECT_FALSE(list.Data().isMember("recommend"));
}

TEST_F(ServerCatalogueTest, MalformedOrMisbehavingServersGiveNoResult) {
  const std::pair<std::string, int> kAnswers[] = {
      {"this is not json", 200},    {"{\"packages\": []}", 200},  // no "recommend"
      {"{\"recommend\": []}", 200},                               // no "packages"
      {"\"a string\"", 200},        {"{\"packages\": [], \"recommend\": []}", 404},
  };
  for (const auto& [body, status] : kAnswers) {
    feed_.PublishRaw(body, status);
    CgiAnswer list = List({{"blforcereload", "true"}});
    EXPECT_FALSE(list.Success()) << body << " -> " << list.body;
  }
  HttpRoute endless;
  endless.endless = true;
  server_.Set("/endless.json", endless);
  HttpRoute slow;
  slow.delay_ms = 3000;
  slow.body = "[]";
  server_.Set("/slow.json", slow);
  for (const char* path : {"/endless.json", "/slow.json"}) {
    Configure(server_.Url(path));
    EXPECT_FALSE(List().Success()) << path;
  }
  Configure("http://127.0.0.1:" + std::to_string(FreeLoopbackPort()) + "/down.json");
  EXPECT_FALSE(List().Success());
  Configure("file:///etc/passwd");
  EXPECT_FALSE(List().Success());
  // A redirect to another protocol is not followed.
  HttpRoute redirect;
  redirect.status = 302;
  redirect.location = "file:///etc/passwd";
  server_.Set("/redirect.json", redirect);
  Configure(server_.Url("/redirect.json"));
  EXPECT_FALSE(List().Success());
}

// Makes every cached catalogue `seconds` older, as if that time had passed
// since it was fetched (its first line is the cache's JSON meta).
void AgeCachedCatalogues(long seconds) {
  std::string dir = KIVORootPath("/var/cache/kivo/pkgserver");
  DIR* d = opendir(dir.c_str());
  ASSERT_NE(nullptr, d) << dir;
  while (struct dirent* e = readdir(d)) {
    std::string path = dir + "/" + e->d_name, text;
    if (e->d_name[0] == '.' || !KIVOReadFile(path, &text)) continue;
    size_t newline = text.find('\n');
    Json::Value meta;
    Json::CharReaderBuilder reader;
    std::istringstream line(text.substr(0, newline));
    if (newline == std::string::npos || !Json::parseFromStream(reader, line, &meta, nullptr)) {
      continue;
    }
    meta["fetched"] = meta["fetched"].asInt64() - seconds;
    Json::StreamWriterBuilder writer;
    writer["indentation"] = "";
    EXPECT_TRUE(KIVOWriteFileAtomic(
        path, Json::writeString(writer, meta) + "\n" + text.substr(newline + 1), SyncToDisk::No));
  }
  closedir(d);
}

TEST_F(ServerCatalogueTest, CachedCatalogueIsRevalidatedWithConditionalRequests) {
  TestPackage a;
  a.id = "cached-a";
  feed_.Add(a);
  ASSERT_TRUE(feed_.Index());
  feed_.Publish("\"v1\"");
  Configure(feed_.Url(), "catalogue_max_age=\"600\"\n");
  const std::string path = "/feed/catalogue.json";
  ASSERT_TRUE(List().Success());
  ASSERT_TRUE(List().Success());
  EXPECT_EQ(1, server_.Requests(path));  // the second came from the cache
  AgeCachedCatalogues(3600);
  CgiAnswer revalidated = List();
  ASSERT_TRUE(revalidated.Success()) << revalidated.body;
  EXPECT_EQ(2, server_.Requests(path));
  EXPECT_NE(std::string::npos, server_.LastHeaders(path).find("If-None-Match: \"v1\""));
  EXPECT_EQ(1u, revalidated.Data()["total"].asUInt());  // from the 304
  ASSERT_TRUE(List({{"blforcereload", "true"}}).Success());
  EXPECT_EQ(3, server_.Requests(path));
  EXPECT_EQ(std::string::npos, server_.LastHeaders(path).find("If-None-Match"));
}

}  // namespace
