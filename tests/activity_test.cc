// The activity log through the real host and the real kivoctl: what the
// web API and the command line record, who may read it, its filters,
// pages and exports, and a command killed half way.

#include <csignal>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/json_text.h"
#include "testing/admin_api_test.h"
#include "testing/cgi_client.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

constexpr char kActivity[] = "KIVO.Core.Package.Activity";
constexpr char kControl[] = "KIVO.Core.Package.Control";

class ActivityTest : public AdminApiTest {
 protected:
  void SetUp() override { Trust(1); }
  void TearDown() override { StopInstalledPackages(); }

  // A package whose start runs `start` (a shell line) and then keeps a
  // service running; its file's path.
  std::string Package(const std::string& id, const std::string& start = "true") {
    TestPackage p;
    p.id = id;
    p.daemon = false;
    p.info["pidfile"] = "pid";
    p.scripts = {{"start-stop-status",
                  "case \"$1\" in\n"
                  "start) " +
                      start +
                      " || exit 1\n"
                      "  sleep 60 >/dev/null 2>&1 </dev/null & echo $! > \"$KIVO_PKG_VAR/pid\";;\n"
                      "stop) kill $(cat \"$KIVO_PKG_VAR/pid\") 2>/dev/null; rm -f "
                      "\"$KIVO_PKG_VAR/pid\";;\n"
                      "status) [ -f \"$KIVO_PKG_VAR/pid\" ] && kill -0 $(cat "
                      "\"$KIVO_PKG_VAR/pid\");;\n"
                      "esac\n"}};
    return p.Build(root_.Path("/tmp/packages"));
  }
  CgiAnswer List(const Params& params) { return client().Call(kActivity, "list", 1, params); }
  // The newest entry of `operation`.
  Json::Value Newest(const std::string& operation) {
    CgiAnswer a = List({{"operation", operation}, {"limit", "1"}});
    EXPECT_TRUE(a.Success()) << a.body;
    return a.Data()["entries"][0];
  }
  static CgiAnswer SignIn(const std::string& account, const std::string& password) {
    std::string body = EncodeForm({{"api", "KIVO.API.Auth"},
                                   {"method", "login"},
                                   {"version", "1"},
                                   {"account", account},
                                   {"passwd", password}});
    return RunEntryCgi({{"REQUEST_METHOD", "POST"},
                        {"CONTENT_TYPE", "application/x-www-form-urlencoded"},
                        {"CONTENT_LENGTH", std::to_string(body.size())},
                        {"REMOTE_ADDR", "192.0.2.7"}},
                       body);
  }
  std::string LogFiles() const {
    std::string db = root_.Path("/var/lib/kivo/activity.db");
    return FileText(db) + FileText(db + "-journal");
  }
};

TEST_F(ActivityTest, ChangesAndSignInsAreRecordedWithTheirCallerAndOutcome) {
  ASSERT_EQ(400, SignIn("admin", "not-the-password-42").Code());
  Json::Value failed = Newest("sign-in failed");
  EXPECT_EQ("admin", failed["actor"].asString());
  EXPECT_EQ("web", failed["origin"].asString());
  EXPECT_EQ("192.0.2.7", failed["address"].asString());
  EXPECT_EQ(400, failed["code"].asInt());
  EXPECT_EQ("failure", failed["state"].asString());

  CgiAnswer install =
      client().Call("KIVO.Core.Package.Installation", "install", 1, {{"path", Package("good")}});
  ASSERT_TRUE(install.Success()) << install.body;
  Json::Value installed = Newest("Installation.install");
  EXPECT_EQ("admin", installed["actor"].asString());
  EXPECT_EQ("success", installed["state"].asString());
  EXPECT_EQ(0, installed["code"].asInt());
  EXPECT_FALSE(installed["ended"].isNull());

  std::string out;
  ASSERT_EQ(0, Kivoctl({"install", Package("broken", "false")}, &out)) << out;
  CgiAnswer start = client().Call(kControl, "start", 1, {{"id", "[\"broken\"]"}});
  ASSERT_FALSE(start.Success()) << start.body;
  Json::Value failed_start = Newest("Control.start");
  EXPECT_EQ("failure", failed_start["state"].asString());
  EXPECT_EQ(start.Code(), failed_start["code"].asInt());
  EXPECT_EQ("broken", failed_start["packages"][0].asString());
  Json::Value by_tool = Newest("Installation.install");
  EXPECT_EQ("kivoctl", by_tool["origin"].asString()) << by_tool;
  EXPECT_EQ("broken-1.0.kpk", by_tool["target"]["file"].asString()) << by_tool;

  ASSERT_TRUE(
      client().Call("KIVO.Core.Package.Setting", "set", 1, {{"update_channel", "Beta"}}).Success());
  Json::Value setting = Newest("Setting.set");
  EXPECT_EQ("Beta", setting["target"]["update_channel"].asString()) << setting;
  EXPECT_EQ("success", setting["state"].asString());

  // Reads are not changes.
  ASSERT_TRUE(client().Call("KIVO.Core.Package", "list", 1).Success());
  EXPECT_EQ(0, List({{"operation", "list"}}).Data()["total"].asInt());

  // Never a password, a session id or a token.
  const std::string files = LogFiles();
  ASSERT_FALSE(files.empty());
  EXPECT_EQ(std::string::npos, files.find("not-the-password-42"));
  EXPECT_EQ(std::string::npos, files.find("secret"));
  EXPECT_EQ(std::string::npos, files.find(client().sid()));
  EXPECT_EQ(std::string::npos, files.find(client().token()));
}

TEST_F(ActivityTest, OnlyAdministratorsMayReadIt) {
  root_.AddAccount("guest", "guest-pw", {"users"});
  ApiClient guest("guest", "guest-pw");
  ASSERT_TRUE(guest.signed_in());
  EXPECT_EQ(105, guest.Call(kActivity, "list", 1).Code());
  EXPECT_EQ(105, guest.Call(kActivity, "export", 1).Code());
  EXPECT_EQ(119, RunEntryCgi({{"REQUEST_METHOD", "GET"},
                              {"QUERY_STRING",
                               "api=KIVO.Core.Package.Activity&method=list&"
                               "version=1"}})
                     .Code());
}

TEST_F(ActivityTest, FiltersPagesAndHostileValues) {
  for (int i = 1; i <= 5; ++i)
    client().Call(kControl, "stop", 1, {{"id", "[\"p" + std::to_string(i) + "\"]"}});
  CgiAnswer one = List({{"package", "p3"}});
  ASSERT_TRUE(one.Success()) << one.body;
  EXPECT_EQ(1, one.Data()["total"].asInt());
  CgiAnswer page = List({{"operation", "Control.stop"}, {"offset", "1"}, {"limit", "2"}});
  EXPECT_EQ(5, page.Data()["total"].asInt());
  ASSERT_EQ(2u, page.Data()["entries"].size());
  EXPECT_EQ("p4", page.Data()["entries"][0]["packages"][0].asString());
  EXPECT_EQ("p3", page.Data()["entries"][1]["packages"][0].asString());
  EXPECT_EQ(0, List({{"account", "nobody"}}).Data()["total"].asInt());
  EXPECT_EQ(0, List({{"since", "253402300799999"}}).Data()["total"].asInt());

  const Params hostile[] = {{{"package", "p1' OR '1'='1"}},
                            {{"outcome", "maybe"}},
                            {{"limit", "501"}},
                            {{"since", "yesterday"}},
                            {{"until", "99999999999999999999"}},
                            {{"offset", "-1"}},
                            {{"operation", "x; DROP TABLE activity"}}};
  for (const Params& p : hostile) EXPECT_EQ(120, List(p).Code()) << p[0].first;
  EXPECT_EQ(5, List({{"operation", "Control.stop"}}).Data()["total"].asInt());
}

TEST_F(ActivityTest, ExportsValidJsonAndCsv) {
  client().Call(kControl, "stop", 1, {{"id", "[\"p1\"]"}});
  ASSERT_EQ(400, SignIn("=cmd|' /C calc'!A0", "x").Code());
  CgiAnswer json = client().Call(kActivity, "export", 1, {{"format", "json"}});
  Json::Value all;
  ASSERT_TRUE(KIVOParseJson(json.body, &all)) << json.body;
  // The administrator's own sign-in, the stop, the failed sign-in.
  ASSERT_EQ(3u, all.size()) << json.body;
  EXPECT_EQ("sign-in failed", all[0]["operation"].asString());
  EXPECT_EQ("sign-in", all[2]["operation"].asString());
  EXPECT_EQ("admin", all[2]["actor"].asString());

  CgiAnswer csv = client().Call(kActivity, "export", 1, {});
  EXPECT_NE(std::string::npos, csv.head.find("text/csv")) << csv.head;
  EXPECT_EQ(0u, csv.body.find("\"id\",\"started\""));
  EXPECT_NE(std::string::npos, csv.body.find("\"'=cmd|' /C calc'!A0\"")) << csv.body;
  EXPECT_NE(std::string::npos, csv.body.find("\"Control.stop\",\"p1\"")) << csv.body;
  size_t lines = 0;
  for (char c : csv.body) lines += c == '\n';
  EXPECT_EQ(4u, lines);
  EXPECT_EQ(120, client().Call(kActivity, "export", 1, {{"format", "xml"}}).Code());
}

TEST_F(ActivityTest, TheLogKeepsItsBound) {
  root_.Write("/etc/kivo/activity.conf", "max_entries=\"3\"\n");
  for (int i = 1; i <= 5; ++i)
    client().Call(kControl, "stop", 1, {{"id", "[\"p" + std::to_string(i) + "\"]"}});
  CgiAnswer all = List({});
  EXPECT_EQ(3, all.Data()["total"].asInt());
  EXPECT_EQ("p3", all.Data()["entries"][2]["packages"][0].asString());
}

TEST_F(ActivityTest, AKivoctlKilledHalfWayLeavesAnUnfinishedEntry) {
  std::string out;
  ASSERT_EQ(
      0, Kivoctl({"install", Package("slow", "touch \"$KIVO_PKG_VAR/starting\"; sleep 30")}, &out))
      << out;
  pid_t pid = fork();
  if (pid == 0) {
    setpgid(0, 0);
    const std::string kivoctl = BuildDir() + "/bin/kivoctl";
    execl(kivoctl.c_str(), "kivoctl", "start", "slow", static_cast<char*>(nullptr));
    _exit(127);
  }
  setpgid(pid, pid);
  for (int i = 0;
       i < 400 && access(root_.Path("/volume1/@appdata/slow/starting").c_str(), F_OK) != 0; ++i)
    usleep(25000);
  Json::Value running = Newest("Control.start");
  EXPECT_EQ("running", running["state"].asString()) << running;
  // The whole group, so that the start script does not outlive the test.
  kill(-pid, SIGKILL);
  waitpid(pid, nullptr, 0);

  CgiAnswer unfinished = List({{"outcome", "unfinished"}});
  ASSERT_EQ(1, unfinished.Data()["total"].asInt()) << unfinished.body;
  Json::Value e = unfinished.Data()["entries"][0];
  EXPECT_EQ("Control.start", e["operation"].asString());
  EXPECT_EQ("kivoctl", e["origin"].asString());
  EXPECT_FALSE(e["actor"].asString().empty());
  EXPECT_EQ("slow", e["packages"][0].asString());
  EXPECT_TRUE(e["ended"].isNull());
}

}  // namespace
