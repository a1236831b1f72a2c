// "Server" "list" with the catalogue's rendered listing kept beside its
// cache: rendered again when the catalogue changes, never trusted when
// damaged, the appliance's state always current, and requests that race
// while it is rendered all answered alike.

#include <dirent.h>
#include <functional>
#include <sys/stat.h>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "pkgtool/registry.h"
#include "testing/admin_api_test.h"
#include "testing/catalogue_feed.h"
#include "testing/cgi_client.h"
#include "testing/http_test_server.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

constexpr char kServer[] = "KIVO.Core.Package.Server";

class ServerListingTest : public AdminApiTest {
 protected:
  void SetUp() override {
    Trust(1);
    Vendor(feed_.Url());
    for (const char* id : {"list-a", "list-b", "list-c"}) {
      TestPackage p;
      p.id = id;
      p.version = "2.0";
      p.info = {{"install_dep_packages", "list-c>=1.0"}};
      feed_.Add(p);
    }
    ASSERT_TRUE(feed_.Index());
    feed_.catalogue()["recommend"] = Json::Value(Json::arrayValue);
    feed_.catalogue()["recommend"].append("list-b");
  }
  void Vendor(const std::string& url) {
    root_.Write("/etc/kivo/pkgserver.conf", VendorConf(url,
                                                       "catalogue_timeout=\"5\"\n"
                                                       "catalogue_max_age=\"600\"\n"));
  }
  // Installs `p` from the vendor's server as it was before it offered 2.0:
  // a catalogue of its own, where the vendor's address points for the
  // install alone, so the catalogue under test is asked nothing.
  void InstallFromTheVendor(const TestPackage& p, bool run) {
    CatalogueFeed earlier(server_, root_.Path("/earlier"), "/earlier");
    ASSERT_TRUE(earlier.Offer(p));
    Vendor(earlier.Url());
    std::vector<std::string> args = {"install-server", p.id};
    if (run) args.push_back("--run");
    std::string out;
    EXPECT_EQ(0, Kivoctl(args, &out)) << out;
    Vendor(feed_.Url());
  }
  void TearDown() override { StopInstalledPackages(); }
  CgiAnswer List(const Params& params = {}) { return client().Call(kServer, "list", 1, params); }
  // The listing file of the vendor's catalogue ("" when there is none).
  std::string ListingFile() {
    std::string dir = root_.Path("/var/cache/kivo/pkgserver/listing"), found;
    DIR* d = opendir(dir.c_str());
    while (struct dirent* e = d && found.empty() ? readdir(d) : nullptr) {
      std::string name = e->d_name;
      if (name.size() > 5 && name.compare(name.size() - 5, 5, ".kivo") == 0)
        found = dir + "/" + name;
    }
    if (d) closedir(d);
    return found;
  }
  std::string ReadListing() {
    std::string text;
    EXPECT_TRUE(KIVOReadFile(ListingFile(), &text)) << ListingFile();
    return text;
  }
  // The time of the listing file's last change, to the nanosecond.
  long long ListingWritten() {
    struct stat st;
    if (stat(ListingFile().c_str(), &st) != 0) return -1;
    return st.st_mtim.tv_sec * 1000000000LL + st.st_mtim.tv_nsec;
  }
  // Applies `edit` to the text of every cached catalogue file.
  void EditCachedCatalogues(const std::function<void(std::string*)>& edit) {
    std::string dir = root_.Path("/var/cache/kivo/pkgserver");
    DIR* d = opendir(dir.c_str());
    ASSERT_NE(nullptr, d);
    while (struct dirent* e = readdir(d)) {
      std::string path = dir + "/" + e->d_name, text;
      if (e->d_type != DT_REG || !KIVOReadFile(path, &text)) continue;
      edit(&text);
      ASSERT_TRUE(KIVOWriteFileAtomic(path, text, SyncToDisk::No));
    }
    closedir(d);
  }
  // Makes the cached catalogue look fetched long ago, so that the next
  // listing asks the server with its ETag.
  void ExpireCachedCatalogue() {
    EditCachedCatalogues([](std::string* text) {
      size_t at = text->find("\"fetched\":");
      ASSERT_NE(std::string::npos, at);
      at += 10;
      text->replace(at, text->find_first_not_of("0123456789", at) - at, "0");
    });
  }

  HttpTestServer server_;
  CatalogueFeed feed_{server_, root_.Path("/feed"), "/feed"};
};

TEST_F(ServerListingTest, ChangedCatalogueIsRenderedAgainAndAnUnchangedOneIsNot) {
  feed_.Publish("\"v1\"");
  client();
  CgiAnswer first = List();
  ASSERT_TRUE(first.Success()) << first.body;
  EXPECT_EQ("2.0", CatalogueEntry(first, "list-a")["version"].asString());
  ASSERT_NE("", ListingFile());
  const std::string rendered = ReadListing();
  const long long written = ListingWritten();
  // From the cache, and revalidated with a 304: the listing stays as it is.
  EXPECT_EQ(first.body, List().body);
  ExpireCachedCatalogue();
  EXPECT_EQ(first.body, List().body);
  EXPECT_EQ(2, server_.Requests("/feed/catalogue.json"));
  EXPECT_EQ(written, ListingWritten());

  // A new catalogue behind a new ETag.
  feed_.Entry("list-a")["version"] = "3.0";
  feed_.Entry("list-b")["conflictpkgs"] = "list-a<3.0";
  feed_.Publish("\"v2\"");
  ExpireCachedCatalogue();
  CgiAnswer changed = List();
  ASSERT_TRUE(changed.Success()) << changed.body;
  EXPECT_EQ(3, server_.Requests("/feed/catalogue.json"));
  EXPECT_EQ("3.0", CatalogueEntry(changed, "list-a")["version"].asString());
  EXPECT_EQ("<",
            CatalogueEntry(changed, "list-b")["conflictpkgs"]["list-a"]["operator"].asString());
  EXPECT_EQ("list-b", changed.Data()["recommend"][0]["id"].asString());
  EXPECT_NE(rendered, ReadListing());
  // And the same answer again from the new listing.
  EXPECT_EQ(changed.body, List().body);
}

TEST_F(ServerListingTest, CacheWithoutADigestIsListedAndGetsOneFromA304) {
  feed_.Publish("\"v1\"");
  client();
  CgiAnswer first = List();
  ASSERT_TRUE(first.Success()) << first.body;
  // As a cache written before its meta named the text's digest.
  auto drop_digest = [](std::string* text) {
    size_t at = text->find("\"digest\":\"");
    ASSERT_NE(std::string::npos, at);
    text->erase(at, text->find(',', at) + 1 - at);
  };
  EditCachedCatalogues(drop_digest);
  const long long written = ListingWritten();
  EXPECT_EQ(first.body, List().body);
  EXPECT_EQ(written, ListingWritten());  // the text's own digest matched
  ExpireCachedCatalogue();
  EXPECT_EQ(first.body, List().body);
  EXPECT_EQ(2, server_.Requests("/feed/catalogue.json"));
  std::string named;
  EditCachedCatalogues([&named](std::string* text) { named = text->substr(0, text->find('\n')); });
  EXPECT_NE(std::string::npos, named.find("\"digest\":\"")) << named;
  EXPECT_EQ(first.body, List().body);
}

TEST_F(ServerListingTest, InstalledAndUninstalledPackagesShowAtOnce) {
  feed_.Publish();
  client();
  CgiAnswer before = List();
  ASSERT_TRUE(before.Success()) << before.body;
  EXPECT_FALSE(CatalogueEntry(before, "list-a").isMember("status"));
  EXPECT_FALSE(before.Data()["blupgrade"].asBool());

  TestPackage old;
  old.id = "list-a";
  old.info = {{"adminport", "8125"}};
  InstallFromTheVendor(old, true);
  CgiAnswer installed = List();
  ASSERT_TRUE(installed.Success()) << installed.body;
  Json::Value a = CatalogueEntry(installed, "list-a");
  EXPECT_EQ("running", a["status"].asString()) << a.toStyledString();
  EXPECT_TRUE(a["blupgrade"].asBool());
  EXPECT_TRUE(installed.Data()["blupgrade"].asBool());
  ASSERT_EQ(1u, a["url"].size());
  EXPECT_EQ("http://nas.example:8125", a["url"][0].asString());
  // The other entries are the listing's text as it was.
  EXPECT_EQ(CatalogueEntry(before, "list-b"), CatalogueEntry(installed, "list-b"));
  EXPECT_EQ(installed.Data()["recommend"][0], CatalogueEntry(installed, "list-b"));

  ASSERT_EQ(0, Kivoctl({"uninstall", "list-a"}));
  CgiAnswer after = List();
  ASSERT_TRUE(after.Success()) << after.body;
  EXPECT_EQ(before.body, after.body);
  EXPECT_EQ(1, server_.Requests("/feed/catalogue.json"));
}

TEST_F(ServerListingTest, DamagedListingIsRenderedAgainNotTrusted) {
  feed_.Publish();
  client();
  CgiAnswer good = List();
  ASSERT_TRUE(good.Success()) << good.body;
  const std::string path = ListingFile(), rendered = ReadListing();
  const size_t text = rendered.find(":{\"") + 1;  // the first entry's text
  ASSERT_NE(0u, text);
  std::string flipped = rendered, unquoted = rendered, longer = rendered;
  flipped[text + 20] ^= 0x01;
  unquoted[text + 1] = 'x';  // a broken entry text of the same length
  longer.insert(rendered.find('\n') + 1, "99999999:");
  const std::vector<std::string> damaged = {
      "",
      rendered.substr(0, rendered.size() / 2),
      rendered.substr(0, rendered.find('\n') + 1),
      "kivo-listing 1 kivo 0 0 1 0\n5:list-a,0:,0:,1:{,",
      "kivo-listing 999 kivo" + rendered.substr(rendered.find(" kivo ") + 5),
      flipped,
      unquoted,
      longer,
      std::string(4096, '\xff'),
  };
  for (const std::string& bad : damaged) {
    ASSERT_TRUE(KIVOWriteFileAtomic(path, bad, SyncToDisk::No));
    CgiAnswer list = List();
    EXPECT_EQ(good.body, list.body) << bad.substr(0, 80);
    EXPECT_EQ(rendered, ReadListing()) << bad.substr(0, 80);
  }
  // A folder in the listing file's place: answered all the same.
  ASSERT_EQ(0, unlink(path.c_str()));
  ASSERT_EQ(0, mkdir(path.c_str(), 0755));
  EXPECT_EQ(good.body, List().body);
}

TEST_F(ServerListingTest, EntriesWithEscapedMemberNamesGetTheirStateToo) {
  // Member names with escapes sort by their unescaped text, not as written.
  feed_.Entry("list-a")["\xc3\xa9tiquette"] = "label";
  feed_.Entry("list-a")["quote\"d"] = 1;
  feed_.Entry("list-b")["\xc3\xa9tiquette"] = "label";
  feed_.Publish();
  TestPackage old;
  old.id = "list-a";
  InstallFromTheVendor(old, false);
  client();
  CgiAnswer list = List();
  ASSERT_TRUE(list.Success()) << list.body;
  Json::Value a = CatalogueEntry(list, "list-a");
  EXPECT_EQ("label", a["\xc3\xa9tiquette"].asString());
  EXPECT_EQ(1, a["quote\"d"].asInt());
  EXPECT_TRUE(a["blupgrade"].asBool());
  EXPECT_TRUE(a.isMember("status")) << a.toStyledString();
  EXPECT_EQ("label", CatalogueEntry(list, "list-b")["\xc3\xa9tiquette"].asString());
  EXPECT_EQ(std::string::npos, list.body.find("\xc3\xa9")) << "answers are ASCII";
}

TEST_F(ServerListingTest, RequestsRacingWhileTheListingIsRenderedAnswerAlike) {
  feed_.Publish("\"v1\"");
  client();
  ASSERT_TRUE(List().Success());
  feed_.Entry("list-c")["version"] = "4.0";
  feed_.Publish("\"v2\"");
  // The slow answer keeps every request in flight at once, each finding the
  // old listing and rendering the new catalogue.
  HttpRoute slow;
  slow.body = feed_.catalogue().toStyledString();
  slow.etag = "\"v2\"";
  slow.delay_ms = 400;
  server_.Set("/feed/catalogue.json", slow);
  ExpireCachedCatalogue();
  std::vector<CgiAnswer> answers(4);
  std::vector<std::thread> requests;
  for (CgiAnswer& answer : answers) requests.emplace_back([&] { answer = List(); });
  for (std::thread& t : requests) t.join();
  for (const CgiAnswer& answer : answers) {
    ASSERT_TRUE(answer.Success()) << answer.body;
    EXPECT_EQ("4.0", CatalogueEntry(answer, "list-c")["version"].asString());
    EXPECT_EQ(answers[0].body, answer.body);
  }
  const long long written = ListingWritten();
  EXPECT_EQ(answers[0].body, List().body);
  EXPECT_EQ(written, ListingWritten());
}

}  // namespace
