// The feed list through the real host against loopback package servers:
// listing, adding with probes and derived names, changing, deleting, and
// the keys a feed publishes being kept for it and dropped with it.

#include <chrono>
#include <functional>
#include <sys/socket.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include <gtest/gtest.h>
#include <json/writer.h>

#include "klibc/atomic_file.h"
#include "pkgserver/feed_keys.h"
#include "testing/admin_api_test.h"
#include "testing/catalogue_feed.h"
#include "testing/cgi_client.h"
#include "testing/gpg_keys.h"
#include "testing/http_test_server.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

#include <arpa/inet.h>
#include <netinet/in.h>

namespace {

constexpr char kFeedApi[] = "KIVO.Core.Package.Feed";
constexpr char kFeedFile[] = "/usr/kivo/etc/packages/feeds";
constexpr char kCatalogue[] = R"({"packages": [], "recommend": []})";

Json::Value Feed(const std::string& feed, const std::string& name = "") {
  Json::Value v(Json::objectValue);
  v["feed"] = feed;
  if (!name.empty()) v["name"] = name;
  return v;
}

class FeedTest : public AdminApiTest {
 protected:
  void SetUp() override {
    root_.Write("/etc/kivo/pkgserver.conf",
                VendorConf("http://127.0.0.1:1/none", "catalogue_timeout=\"2\"\n"));
    Serve("/a", kCatalogue);
    Serve("/b", kCatalogue);
  }
  void Serve(const std::string& path, const std::string& body, int status = 200) {
    HttpRoute route;
    route.status = status;
    route.body = body;
    server_.Set(path, route);
  }
  CgiAnswer Call(const std::string& method, const Params& params = {}) {
    return client().Call(kFeedApi, method, 1, params);
  }
  CgiAnswer Add(const Json::Value& item) { return Call("add", {{"list", ListParam(item)}}); }
  CgiAnswer Set(const Json::Value& change) { return Call("set", {{"list", ListParam(change)}}); }
  std::string FeedFile() {
    std::string text;
    return KIVOReadFile(root_.Path(kFeedFile), &text) ? text : "<missing>";
  }
  Json::Value Items() { return Call("list").Data()["items"]; }
  std::string Url(const std::string& path) { return server_.Url(path); }

  HttpTestServer server_;
};

TEST_F(FeedTest, ListsNoFileAnEmptyFileAndAnEmptyArray) {
  CgiAnswer a = Call("list");
  ASSERT_TRUE(a.Success()) << a.body;
  EXPECT_EQ(0u, a.Data()["total"].asUInt());
  EXPECT_TRUE(a.Data()["items"].isArray());
  root_.Write(kFeedFile, "");
  a = Call("list");
  ASSERT_TRUE(a.Success()) << a.body;
  EXPECT_EQ(0u, a.Data()["total"].asUInt());
  root_.Write(kFeedFile, "[]");
  EXPECT_EQ(0u, Call("list").Data()["total"].asUInt());
  root_.Write(kFeedFile, "[{\"feed\": \"http://x/\", \"name\": \"x\", \"extra\": 1}]");
  a = Call("list");
  EXPECT_EQ(1u, a.Data()["total"].asUInt());
  EXPECT_EQ(1, a.Data()["items"][0]["extra"].asInt());
  root_.Write(kFeedFile, "[not json");
  EXPECT_EQ(4501, Call("list").Code());
  // "set" and "delete" need a file.
  std::remove(root_.Path(kFeedFile).c_str());
  EXPECT_EQ(4501, Call("delete", {{"list", ListParam(Json::Value(Json::arrayValue))}}).Code());
  EXPECT_EQ(4501, Set(Feed(Url("/a"))).Code());
}

TEST_F(FeedTest, AddDerivesNamesRefusesDuplicatesAndFailedProbes) {
  const std::string with_path = Url("/a");  // http://127.0.0.1:N/a
  CgiAnswer a = Add(Feed(with_path));
  ASSERT_TRUE(a.Success()) << a.body;
  // No keyrings published; the catalogue lists no package.
  EXPECT_FALSE(a.Data().isMember("has_keyrings")) << a.body;
  EXPECT_EQ(Json::Value(0), a.Data()["packages"]) << a.body;
  // An address with "//" and no later "/" is served at "/".
  Serve("/", kCatalogue);
  const std::string bare = "http://127.0.0.1:" + std::to_string(server_.port());
  ASSERT_TRUE(Add(Feed(bare)).Success());
  Json::Value items = Items();
  ASSERT_EQ(2u, items.size());
  EXPECT_EQ("127.0.0.1:" + std::to_string(server_.port()), items[0]["name"].asString());
  EXPECT_EQ(items[0]["name"], items[1]["name"]);
  EXPECT_EQ(with_path, items[0]["feed"].asString());

  // A duplicate is refused without asking the server.
  int before = server_.Requests("/a");
  EXPECT_EQ(4591, Add(Feed(with_path, "again")).Code());
  EXPECT_EQ(before, server_.Requests("/a"));

  // An address without "//" is no http(s) address: its own name, never stored.
  const std::string file = FeedFile();
  CgiAnswer no_scheme = Add(Feed("packages.example"));
  EXPECT_EQ(4590, no_scheme.Code()) << no_scheme.body;
  EXPECT_EQ(4500, Add(Json::Value(Json::objectValue)).Code());
  EXPECT_EQ(4500, Add(Feed("")).Code());
  EXPECT_EQ(4501, Call("add", {{"list", "\"{not json\""}}).Code());

  // Down, 404, not JSON, slow: all 4590, promptly, and the file unchanged.
  Serve("/404", "gone", 404);
  Serve("/garbage", "<html>hello</html>");
  HttpRoute slow;
  slow.body = kCatalogue;
  slow.delay_ms = 4000;
  server_.Set("/slow", slow);
  for (const std::string& url : {std::string("http://127.0.0.1:1/down"), Url("/404"),
                                 Url("/garbage"), Url("/slow"), std::string("ftp://x/y")}) {
    EXPECT_EQ(4590, Add(Feed(url)).Code()) << url;
  }
  EXPECT_EQ(file, FeedFile());
}

// A listening socket whose connections the kernel accepts and nobody ever
// answers: a server that is up and silent.
class SilentServer {
 public:
  SilentServer() {
    fd_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t len = sizeof(addr);
    if (fd_ >= 0 && bind(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) == 0 &&
        listen(fd_, 16) == 0 && getsockname(fd_, reinterpret_cast<sockaddr*>(&addr), &len) == 0) {
      port_ = ntohs(addr.sin_port);
    }
  }
  ~SilentServer() {
    if (fd_ >= 0) close(fd_);
  }
  int port() const { return port_; }

 private:
  int fd_ = -1;
  int port_ = 0;
};

// The probe is held to its own bound (10 seconds), however long the root
// lets a catalogue take: a person waits on the page for it.
TEST_F(FeedTest, ProbeOfASilentServerEndsWithinItsBound) {
  ASSERT_TRUE(Add(Feed(Url("/a"))).Success());
  const std::string file = FeedFile();
  root_.Write("/etc/kivo/pkgserver.conf",
              "vendor_url=\"http://127.0.0.1:1/none\"\nconnect_timeout=\"60\"\n"
              "catalogue_timeout=\"31\"\n");
  SilentServer silent;
  ASSERT_NE(0, silent.port());
  // One server that never answers, one whose answer begins and stops.
  HttpRoute stalled;
  stalled.body = kCatalogue;
  stalled.hold_after = 1;
  server_.Set("/stalled", stalled);
  const std::string quiet = "http://127.0.0.1:" + std::to_string(silent.port()) + "/catalogue";
  Json::Value change = Feed(quiet);
  change["orifeed"] = Url("/a");
  const std::vector<std::pair<std::string, std::function<CgiAnswer()>>> probes = {
      {"add " + quiet, [&] { return Add(Feed(quiet)); }},
      {"set " + quiet, [&] { return Set(change); }},
      {"add /stalled", [&] { return Add(Feed(Url("/stalled"))); }}};
  for (const auto& [what, probe] : probes) {
    const auto start = std::chrono::steady_clock::now();
    CgiAnswer a = probe();
    const std::chrono::duration<double> took = std::chrono::steady_clock::now() - start;
    EXPECT_EQ(4590, a.Code()) << what << ": " << a.body;
    EXPECT_LT(took.count(), 30.0) << what << " (seconds)";
  }
  EXPECT_EQ(file, FeedFile());
  server_.Release();
}

TEST_F(FeedTest, SetDerivesTheNameOfTheNewAddress) {
  ASSERT_TRUE(Add(Feed(Url("/a"), "A")).Success());
  Json::Value change = Feed(Url("/b"));
  change["orifeed"] = Url("/a");
  ASSERT_TRUE(Set(change).Success());
  EXPECT_EQ("127.0.0.1:" + std::to_string(server_.port()), Items()[0]["name"].asString());
}

TEST_F(FeedTest, SetRefusesMissingAddressesClashesAndDeadFeeds) {
  ASSERT_TRUE(Add(Feed(Url("/a"), "A")).Success());
  ASSERT_TRUE(Add(Feed(Url("/b"), "B")).Success());
  const std::string file = FeedFile();
  EXPECT_EQ(4501, Set(Feed(Url("/c"))).Code());  // no "orifeed"
  Json::Value no_feed(Json::objectValue);
  no_feed["orifeed"] = Url("/a");
  EXPECT_EQ(4501, Set(no_feed).Code());
  Json::Value clash = Feed(Url("/b"));
  clash["orifeed"] = Url("/a");
  EXPECT_EQ(4591, Set(clash).Code());
  Json::Value dead = Feed("http://127.0.0.1:1/dead");
  dead["orifeed"] = Url("/a");
  EXPECT_EQ(4590, Set(dead).Code());
  EXPECT_EQ(file, FeedFile());

  Serve("/c", kCatalogue);
  Json::Value good = Feed(Url("/c"), "C");
  good["orifeed"] = Url("/a");
  CgiAnswer a = Set(good);
  ASSERT_TRUE(a.Success()) << a.body;
  EXPECT_EQ(Json::Value(0), a.Data()["packages"]) << a.body;
  Json::Value items = Items();
  ASSERT_EQ(2u, items.size());
  EXPECT_EQ(Url("/c"), items[0]["feed"].asString());
  EXPECT_EQ("C", items[0]["name"].asString());
  EXPECT_EQ(Url("/b"), items[1]["feed"].asString());
}

TEST_F(FeedTest, DeleteRemovesTwoAndKeepsTheOrder) {
  for (const char* p : {"/c", "/d", "/e"}) Serve(p, kCatalogue);
  for (const char* p : {"/a", "/b", "/c", "/d", "/e"}) ASSERT_TRUE(Add(Feed(Url(p))).Success());
  Json::Value gone(Json::arrayValue);
  gone.append(Url("/d"));
  gone.append(Url("/b"));
  gone.append("http://not.listed/");
  CgiAnswer a = Call("delete", {{"list", ListParam(gone)}});
  ASSERT_TRUE(a.Success()) << a.body;
  Json::Value items = Items();
  ASSERT_EQ(3u, items.size());
  EXPECT_EQ(Url("/a"), items[0]["feed"].asString());
  EXPECT_EQ(Url("/c"), items[1]["feed"].asString());
  EXPECT_EQ(Url("/e"), items[2]["feed"].asString());
}

TEST_F(FeedTest, KeysArePublishedKeptPerFeedAndDropped) {
  Json::Value catalogue(Json::objectValue);
  catalogue["packages"] = Json::Value(Json::arrayValue);
  catalogue["recommend"] = Json::Value(Json::arrayValue);
  TestKeys keys(root_.Path("/publisher"));
  const std::string fpr = keys.Create("Feed Publisher <feed@test.invalid>");
  const std::string secret = keys.Export(fpr, true);
  // A secret key in the armor of a public one is judged by its packets.
  const std::string disguised = InPublicArmor(secret);
  const std::string garbled =
      "-----BEGIN PGP PUBLIC KEY BLOCK-----\n\nmDMEZxxx\n=abcd\n"
      "-----END PGP PUBLIC KEY BLOCK-----\n";
  for (const std::string& key :
       {keys.Export(fpr), secret, disguised, garbled, std::string("not a key")}) {
    catalogue["keyrings"].append(key);
  }
  Json::StreamWriterBuilder b;
  Serve("/keys", Json::writeString(b, catalogue));
  Serve("/keys2", Json::writeString(b, catalogue));

  CgiAnswer a = Add(Feed(Url("/keys")));
  ASSERT_TRUE(a.Success()) << a.body;
  EXPECT_TRUE(a.Data()["has_keyrings"].asBool());
  setenv("KIVO_ROOT", root_.dir().c_str(), 1);
  // Only the public key is kept, and only for that feed.
  ASSERT_EQ(1u, KIVOPackageServer::PMSFeedKeys(Url("/keys")).size());
  EXPECT_EQ(KIVOPackageServer::PMSFeedKeys(Url("/keys"))[0].find("-----BEGIN PGP PUBLIC"), 0u);
  std::string stored;
  ASSERT_EQ(
      0, RunProgram({"sh", "-c", "cat '" + root_.Path("/usr/kivo/etc/packages/feed_keys") + "'/*"},
                    &stored));
  const std::string secret_line = disguised.substr(disguised.find("\n\n") + 2, 60);
  EXPECT_EQ(std::string::npos, stored.find(secret_line)) << "the secret key was stored";
  EXPECT_TRUE(KIVOPackageServer::PMSFeedKeys(Url("/a")).empty());

  // Moving the feed moves its keys; deleting it drops them.
  Json::Value move = Feed(Url("/keys2"));
  move["orifeed"] = Url("/keys");
  ASSERT_TRUE(Set(move).Success());
  EXPECT_TRUE(KIVOPackageServer::PMSFeedKeys(Url("/keys")).empty());
  EXPECT_EQ(1u, KIVOPackageServer::PMSFeedKeys(Url("/keys2")).size());
  Json::Value gone(Json::arrayValue);
  gone.append(Url("/keys2"));
  ASSERT_TRUE(Call("delete", {{"list", ListParam(gone)}}).Success());
  EXPECT_TRUE(KIVOPackageServer::PMSFeedKeys(Url("/keys2")).empty());

  // A feed that publishes no keys answers no "has_keyrings".
  EXPECT_FALSE(Add(Feed(Url("/a"))).Data().isMember("has_keyrings"));
}

TEST_F(FeedTest, ConcurrentAddsAreBothKept) {
  // Slow servers keep both probes in flight at once; the list is changed
  // under its lock afterwards, so neither add is lost.
  for (const char* p : {"/s1", "/s2", "/s3", "/s4"}) {
    HttpRoute slow;
    slow.body = kCatalogue;
    slow.delay_ms = 300;
    server_.Set(p, slow);
  }
  std::vector<std::thread> threads;
  std::vector<int> ok(4, 0);
  const char* paths[] = {"/s1", "/s2", "/s3", "/s4"};
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&, i] { ok[i] = Add(Feed(Url(paths[i]))).Success(); });
  }
  for (std::thread& t : threads) t.join();
  EXPECT_EQ(std::vector<int>(4, 1), ok);
  EXPECT_EQ(4u, Items().size());
}

}  // namespace
