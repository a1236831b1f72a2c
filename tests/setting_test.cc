// The package center's settings, default volume and start-up information
// through the real host on a temporary root.

#include <ctime>
#include <memory>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "klibc/key_value_file.h"
#include "klibc/process.h"
#include "settings/web_utils.h"
#include "testing/admin_api_test.h"
#include "testing/cgi_client.h"
#include "testing/http_test_server.h"
#include "testing/temp_root.h"

namespace {

constexpr char kSetting[] = "KIVO.Core.Package.Setting";
constexpr char kVolume[] = "KIVO.Core.Package.Setting.Volume";
constexpr char kUpdate[] = "KIVO.Core.Package.Setting.Update";
constexpr char kInfo[] = "KIVO.Core.Package.Info";

class SettingTest : public AdminApiTest {
 protected:
  // One sign-in per test: each one costs a deliberate password hash.
  void SetUp() override { ASSERT_TRUE(client().signed_in()); }

  CgiAnswer Call(const char* api, const char* method, const Params& params = {}) {
    return client().Call(api, method, 1, params);
  }

  void Volumes(const std::string& json) { root_.Write("/etc/kivo/volumes.json", json); }
  void SetInfo(const std::string& key, const std::string& value) {
    ASSERT_TRUE(KIVOKeyValueSet(root_.Path("/etc/kivoinfo.conf"), key, value));
  }
  std::string Info(const std::string& key) {
    KeyValueMap values;
    EXPECT_TRUE(KIVOKeyValueLoad(root_.Path("/etc/kivoinfo.conf"), &values));
    return values[key];
  }
  void Install(const std::string& id) {
    root_.Write("/var/packages/" + id + "/INFO", "package=\"" + id + "\"\nversion=\"1.0\"\n");
  }
  Json::Value ChosenList() {
    Json::Value list;
    EXPECT_TRUE(WebUtils::LoadJsonFile(root_.Path("/usr/kivo/etc/packages/autoupdate.json"), list));
    return list;
  }
  void MailSetUp() { root_.Write("/etc/kivo/mail.conf", "smtp_server=\"mail.example.com\"\n"); }
};

TEST_F(SettingTest, DefaultVolumeGetAndSetWithEachVolumeState) {
  root_.Write("/volume2/.keep", "");
  root_.Write("/volume3/.keep", "");
  Volumes(
      R"([{"path": "/volume1", "status": "normal"}, {"path": "/volume2", "status": "crashed"},
          {"path": "/volume3", "status": "normal", "cap_bytes": 1}])");
  CgiAnswer none = Call(kVolume, "get");
  ASSERT_TRUE(none.Success()) << none.body;
  EXPECT_FALSE(none.json.isMember("data")) << none.body;

  ASSERT_TRUE(Call(kVolume, "set", {{"default_vol", "/volume1"}}).Success());
  EXPECT_EQ("/volume1", Call(kVolume, "get").Data()["default_vol"].asString());

  EXPECT_EQ(4504, Call(kVolume, "set", {{"default_vol", "/volume3"}}).Code());
  EXPECT_EQ(4502, Call(kVolume, "set", {{"default_vol", "/volume2"}}).Code());
  EXPECT_EQ(4502, Call(kVolume, "set", {{"default_vol", "/volume9"}}).Code());
  EXPECT_EQ("/volume1", Info("pkg_def_volume")) << "a refused set leaves the old one";

  // The stored volume later changes state under the setting.
  const struct {
    const char* volume;
    const char* status;
  } states[] = {{"/volume2", "crashed"}, {"/volume3", "no_space"}, {"/volume9", "no_found"}};
  for (const auto& s : states) {
    SetInfo("pkg_def_volume", s.volume);
    CgiAnswer a = Call(kVolume, "get");
    EXPECT_EQ(4501, a.Code()) << a.body;
    EXPECT_EQ(s.status, a.Errors()["volume_status"].asString()) << s.volume;
    // Settings "get" reports the same state without failing.
    CgiAnswer settings = Call(kSetting, "get");
    ASSERT_TRUE(settings.Success()) << settings.body;
    EXPECT_EQ(s.status, settings.Data()["volume_status"].asString());
  }
  ASSERT_TRUE(Call(kVolume, "set", {{"default_vol", ""}}).Success());
  EXPECT_TRUE(Call(kVolume, "get").Data().isNull());
}

TEST_F(SettingTest, SettingsRoundTrip) {
  MailSetUp();
  CgiAnswer set = Call(kSetting, "set",
                       {{"update_channel", "beta"},
                        {"enable_email", "true"},
                        {"enable_nvx", "false"},
                        {"trust_level", "2"},
                        {"enable_autoupdate", "true"},
                        {"autoupdateall", "false"},
                        {"packages", R"(["demo-web","demo-notes"])"},
                        {"default_vol", "/volume1"}});
  ASSERT_TRUE(set.Success()) << set.body;
  EXPECT_EQ("beta", set.Data()["update_channel"].asString());
  EXPECT_TRUE(set.Data()["enable_email"].asBool());
  EXPECT_FALSE(set.Data()["enable_nvx"].asBool());

  CgiAnswer get = Call(kSetting, "get");
  ASSERT_TRUE(get.Success()) << get.body;
  const Json::Value& d = get.Data();
  EXPECT_TRUE(d["enable_email"].asBool());
  EXPECT_FALSE(d["enable_nvx"].asBool());
  EXPECT_TRUE(d["mailset"].asBool());
  EXPECT_EQ(2, d["trust_level"].asInt());
  EXPECT_TRUE(d["update_channel"].asBool());
  EXPECT_EQ("/volume1", d["default_vol"].asString());
  EXPECT_EQ(1u, d["volume_count"].asUInt());
  EXPECT_TRUE(d["enable_autoupdate"].asBool());
  EXPECT_FALSE(d["autoupdateall"].asBool());
  EXPECT_EQ(Json::Value("demo-web"), ChosenList()[0]);

  KeyValueMap schedule;
  ASSERT_TRUE(KIVOKeyValueLoad(root_.Path("/etc/kivo/update_notify.conf"), &schedule));
  EXPECT_EQ("-1", schedule["notify_hour"]);

  // A capital letter is not "beta"; every other value goes back to off.
  ASSERT_TRUE(Call(kSetting, "set", {{"update_channel", "Beta"}}).Success());
  EXPECT_EQ("stable", Info("package_update_channel"));
  const Json::Value after = Call(kSetting, "get").Data();
  EXPECT_FALSE(after["update_channel"].asBool());
  EXPECT_FALSE(after["enable_autoupdate"].asBool());
  EXPECT_TRUE(after["autoupdateall"].asBool());
  EXPECT_EQ(0, after["trust_level"].asInt());
}

TEST_F(SettingTest, SetFailuresSayWhatFailed) {
  // Mail not set up: the mail notice is stored off.
  CgiAnswer nomail = Call(kSetting, "set", {{"enable_email", "true"}, {"enable_nvx", "true"}});
  ASSERT_TRUE(nomail.Success()) << nomail.body;
  EXPECT_FALSE(nomail.Data()["enable_email"].asBool());
  EXPECT_FALSE(Call(kSetting, "get").Data()["mailset"].asBool());
  root_.Write("/etc/kivo/mail.conf", "smtp_server=\"\"\n");
  EXPECT_FALSE(Call(kSetting, "get").Data()["mailset"].asBool());

  // A full volume: the earlier steps stay done.
  Volumes(R"([{"path": "/volume1", "status": "normal", "cap_bytes": 1}])");
  CgiAnswer full = Call(kSetting, "set", {{"trust_level", "3"}, {"default_vol", "/volume1"}});
  EXPECT_EQ(4504, full.Code()) << full.body;
  EXPECT_EQ("3", Info("pkg_source_trust_level"));

  // An unwritable list of chosen packages: the step is named.
  const std::string list_file = root_.Path("/usr/kivo/etc/packages/autoupdate.json");
  ASSERT_EQ(0, KLIBCExec("/bin/rm", "-f", list_file.c_str(), nullptr, nullptr));
  ASSERT_EQ(0, mkdir(list_file.c_str(), 0755));
  CgiAnswer list = Call(kSetting, "set", {{"enable_autoupdate", "true"}, {"packages", "[]"}});
  EXPECT_EQ(4501, list.Code()) << list.body;
  EXPECT_EQ("autoupdate", list.Errors()["failed"].asString());

  // An unwritable settings file: the first key names itself, nothing else moves.
  ASSERT_EQ(0,
            KLIBCExec("/bin/rm", "-f", root_.Path("/etc/kivoinfo.conf").c_str(), nullptr, nullptr));
  ASSERT_EQ(0, mkdir(root_.Path("/etc/kivoinfo.conf").c_str(), 0755));
  CgiAnswer info = Call(kSetting, "set", {{"trust_level", "1"}});
  EXPECT_EQ(4501, info.Code()) << info.body;
  EXPECT_EQ("trust_level", info.Errors()["failed"].asString());
}

TEST_F(SettingTest, AutomaticUpdateAddAndDeleteUnderEachMode) {
  Install("alpha");
  Install("beta");
  Install("gamma");
  auto ids = [&] {
    std::string out;
    for (const Json::Value& id : ChosenList()) out += id.asString() + " ";
    return out;
  };
  // Off: "add" chooses just the one, "delete" none; either way it turns on.
  ASSERT_TRUE(Call(kUpdate, "add", {{"id", "beta"}}).Success());
  EXPECT_EQ("beta ", ids());
  EXPECT_EQ("yes", Info("enable_pkg_autoupdate_all"));
  EXPECT_EQ("no", Info("pkg_autoupdate_all"));
  SetInfo("enable_pkg_autoupdate_all", "no");
  ASSERT_TRUE(Call(kUpdate, "delete", {{"id", "beta"}}).Success());
  EXPECT_EQ("", ids());

  // All: "delete" turns it into a chosen list of all the others.
  SetInfo("pkg_autoupdate_all", "YES");
  ASSERT_TRUE(Call(kUpdate, "delete", {{"id", "beta"}}).Success());
  EXPECT_EQ("alpha gamma ", ids());
  SetInfo("pkg_autoupdate_all", "yes");
  ASSERT_TRUE(Call(kUpdate, "add", {{"id", "beta"}}).Success());
  EXPECT_EQ("alpha beta gamma ", ids());

  // Chosen: no duplicates, and "delete" drops the id.
  ASSERT_TRUE(Call(kUpdate, "add", {{"id", "beta"}}).Success());
  ASSERT_TRUE(Call(kUpdate, "add", {{"id", "delta"}}).Success());
  EXPECT_EQ("alpha beta gamma delta ", ids());
  ASSERT_TRUE(Call(kUpdate, "delete", {{"id", "alpha"}}).Success());
  EXPECT_EQ("beta gamma delta ", ids());
  CgiAnswer get = Call(kSetting, "get");
  EXPECT_TRUE(get.Data()["enable_autoupdate"].asBool());
  EXPECT_FALSE(get.Data()["autoupdateall"].asBool());

  EXPECT_EQ(4501, Call(kUpdate, "add", {{"id", ""}}).Code());
  root_.Write("/usr/kivo/etc/packages/autoupdate.json", "{broken");
  EXPECT_EQ(4501, Call(kUpdate, "add", {{"id", "alpha"}}).Code());
}

// The chosen list also comes as a JSON text (a string parameter holding the
// array): its ids are stored. A text that is not JSON, or whose ids are not
// package ids, is the handler's 4500 and stores nothing of the request.
TEST_F(SettingTest, ChosenListAsJsonText) {
  CgiAnswer set = Call(kSetting, "set",
                       {{"enable_autoupdate", "true"},
                        {"autoupdateall", "false"},
                        {"packages", R"("[\"demo-web\",\"demo-notes\"]")"}});
  ASSERT_TRUE(set.Success()) << set.body;
  ASSERT_EQ(2u, ChosenList().size());
  EXPECT_EQ("demo-web", ChosenList()[0].asString());
  EXPECT_EQ("demo-notes", ChosenList()[1].asString());

  for (const char* text :
       {"[\"a\"", R"("[\"a\",")", R"("[\"../x\"]")", R"("{\"a\":1}")", R"(["../x"])"}) {
    CgiAnswer refused = Call(kSetting, "set", {{"trust_level", "3"}, {"packages", text}});
    EXPECT_EQ(4500, refused.Code()) << text << " " << refused.body;
    EXPECT_NE("3", Info("pkg_source_trust_level")) << text;
  }
  ASSERT_EQ(2u, ChosenList().size());
}

class InfoTest : public SettingTest {
 protected:
  static HttpRoute Route(int status, const std::string& body) {
    HttpRoute route;
    route.status = status;
    route.body = body;
    return route;
  }
  void SetUp() override {
    SettingTest::SetUp();
    server_.Set("/company-info", Route(200, R"({"content_hash":"h2"})"));
    root_.Write("/etc/kivo/pkgserver.conf",
                "company_info_url=\"" + server_.Url("/company-info") + "\"\n");
  }
  Json::Value Load() {
    CgiAnswer a = Call(kInfo, "get");
    EXPECT_TRUE(a.Success()) << a.body;
    return a.Data();
  }
  std::string SettingsPath() { return "/usr/kivo/etc/users/admin/settings.json"; }
  void WriteSettings(const Json::Value& app) {
    Json::Value doc(Json::objectValue);
    doc["KIVO.PXS.PkgManApp.Instance"] = app;
    ASSERT_TRUE(WebUtils::SaveJsonFile(root_.Path(SettingsPath()), doc));
  }
  Json::Value Agreed(const std::string& hash) {
    Json::Value app(Json::objectValue);
    app["termofservice"] = true;
    app["termofservice_4_2"] = true;
    app["agreed_tos_hash"] = hash;
    return app;
  }

  HttpTestServer server_;
};

TEST_F(InfoTest, FirstAndSecondVisit) {
  Install("alpha");
  Json::Value first = Load();
  EXPECT_FALSE(first["has_packages"].asBool());
  EXPECT_EQ("", first["def_void"].asString());
  EXPECT_EQ("new", first["show_tos"].asString());
  EXPECT_EQ("h2", first["tos_hash"].asString());
  EXPECT_FALSE(first["blOtherServer"].asBool());
  EXPECT_TRUE(Load()["has_packages"].asBool());

  ASSERT_TRUE(Call(kVolume, "set", {{"default_vol", "/volume1"}}).Success());
  EXPECT_EQ("/volume1", Load()["def_void"].asString());
}

TEST_F(InfoTest, TermsOfServiceStates) {
  // Agreed to the current text; the fetched hash is cached in the settings.
  WriteSettings(Agreed("h2"));
  Json::Value now = Load();
  EXPECT_EQ("no", now["show_tos"].asString());
  int fetched = now["tos_hash_timestamp"].asInt();
  EXPECT_NEAR(time(nullptr), fetched, 5);
  Json::Value stored;
  ASSERT_TRUE(WebUtils::LoadJsonFile(root_.Path(SettingsPath()), stored));
  EXPECT_EQ("h2", stored["KIVO.PXS.PkgManApp.Instance"]["tos_hash"].asString());
  EXPECT_EQ(1, server_.Requests("/company-info"));
  EXPECT_NE(std::string::npos, server_.LastQuery("/company-info").find("action=getTOSContentHash"));

  // A cached hash 3599 seconds old is used; 3600 seconds old is fetched again.
  Json::Value app = Agreed("h1");
  app["tos_hash"] = "h1";
  app["tos_hash_timestamp"] = static_cast<int>(time(nullptr)) - 3590;
  WriteSettings(app);
  Json::Value cached = Load();
  EXPECT_EQ("no", cached["show_tos"].asString());
  EXPECT_EQ("h1", cached["tos_hash"].asString());
  EXPECT_EQ(app["tos_hash_timestamp"].asInt(), cached["tos_hash_timestamp"].asInt());
  EXPECT_EQ(1, server_.Requests("/company-info"));
  app["tos_hash_timestamp"] = static_cast<int>(time(nullptr)) - 3600;
  WriteSettings(app);
  Json::Value stale = Load();
  EXPECT_EQ("change", stale["show_tos"].asString());
  EXPECT_EQ("h2", stale["tos_hash"].asString());
  EXPECT_EQ(2, server_.Requests("/company-info"));

  // Agreed to an older edition.
  Json::Value old = Agreed("h2");
  old["termofservice_4_2"] = false;
  WriteSettings(old);
  EXPECT_EQ("change", Load()["show_tos"].asString());
}

TEST_F(InfoTest, EndpointDownOrUnusable) {
  server_.Set("/company-info", Route(503, "down"));
  Json::Value nothing = Load();
  EXPECT_EQ("new", nothing["show_tos"].asString());
  EXPECT_EQ("", nothing["tos_hash"].asString());
  EXPECT_EQ(0, nothing["tos_hash_timestamp"].asInt());

  // A user who agreed earlier is asked again while the hash cannot be confirmed.
  WriteSettings(Agreed("h2"));
  EXPECT_EQ("change", Load()["show_tos"].asString());
  server_.Set("/company-info", Route(200, R"({"other":1})"));
  EXPECT_EQ("change", Load()["show_tos"].asString());

  // Settings that cannot be read leave everything at its defaults.
  root_.Write(SettingsPath(), "{not json");
  Json::Value broken = Load();
  EXPECT_EQ("no", broken["show_tos"].asString());
  EXPECT_EQ("", broken["tos_hash"].asString());
}

TEST_F(InfoTest, FeedsFileStates) {
  const std::string feeds = "/usr/kivo/etc/packages/feeds";
  ASSERT_EQ(0, unlink(root_.Path(feeds).c_str()));
  EXPECT_FALSE(Load()["blOtherServer"].asBool()) << "missing";
  root_.Write(feeds, "");
  EXPECT_FALSE(Load()["blOtherServer"].asBool()) << "empty";
  root_.Write(feeds, "[]");
  EXPECT_FALSE(Load()["blOtherServer"].asBool()) << "[]";
  root_.Write(feeds, "[oops");
  EXPECT_FALSE(Load()["blOtherServer"].asBool()) << "damaged";
  root_.Write(feeds, R"([{"feed": "https://feed.example.com/", "name": "One"}])");
  EXPECT_TRUE(Load()["blOtherServer"].asBool()) << "one feed";
}

}  // namespace
