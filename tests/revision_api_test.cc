// KIVO.Core.Package.Revision through the real host on a temporary root,
// with packages built by the project's tool and upgraded by kivoctl: the
// kept earlier version as list tells it, a rollback run by a worker that
// outlives its request, its undo, dropping the kept copy, the refusals, the
// version an automatic update failed to install, and the activity log's
// entries of each change.

#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/json_text.h"
#include "pkgtool/registry.h"
#include "testing/admin_api_test.h"
#include "testing/package_factory.h"

namespace {

constexpr char kRevision[] = "KIVO.Core.Package.Revision";
constexpr char kActivity[] = "KIVO.Core.Package.Activity";

class RevisionApiTest : public AdminApiTest {
 protected:
  void SetUp() override {
    Trust(1);
    dir_ = root_.Path("/tmp/packages");
    data_ = root_.Path("/volume1/@appdata/test-app");
    v1_.scripts = {{"postinst", "echo 'written by 1.0' > \"$KIVO_PKG_VAR/notes\"\n"}};
    v2_ = v1_;
    v2_.version = "2.0";
    v2_.scripts = {{"postupgrade", "echo 'migrated by 2.0' > \"$KIVO_PKG_VAR/notes\"\n"}};
  }
  void TearDown() override {
    Open();
    StopInstalledPackages();
  }

  // Installs (or upgrades to) `p` with kivoctl and `extra` arguments.
  void Install(const TestPackage& p, const std::vector<std::string>& extra = {}) {
    std::vector<std::string> args = {"install", p.Build(dir_)};
    args.insert(args.end(), extra.begin(), extra.end());
    std::string out;
    ASSERT_EQ(0, Kivoctl(args, &out)) << out;
  }
  std::string Status() {
    std::string out;
    Kivoctl({"status", "test-app"}, &out);
    return out;
  }
  std::string Notes() { return FileText(data_ + "/notes"); }

  CgiAnswer Call(const std::string& method, const Params& params = {{"id", "test-app"}}) {
    return client().Call(kRevision, method, 1, params);
  }
  Json::Value Entry() {
    CgiAnswer a = Call("list");
    EXPECT_TRUE(a.Success()) << a.body;
    return a.Data()["packages"][0];
  }
  // Polls list every 50 ms until the rollback of test-app is no longer
  // running (at most about 30 s); its last state.
  Json::Value RollbackEnd() {
    Json::Value rollback;
    for (int i = 0; i < 600; ++i) {
      rollback = Entry()["rollback"];
      if (rollback["state"].asString() != "running") break;
      usleep(50000);
    }
    return rollback;
  }
  Json::Value Newest(const std::string& operation) {
    CgiAnswer a = client().Call(kActivity, "list", 1, {{"operation", operation}, {"limit", "1"}});
    EXPECT_TRUE(a.Success()) << a.body;
    return a.Data()["entries"][0];
  }

  // A version whose stop waits until Open() was called: the window in which
  // a rollback away from it is under way.
  TestPackage Gated(TestPackage p) {
    p.scripts["start-stop-status"] =
        "PIDFILE=\"$KIVO_PKG_VAR/daemon.pid\"\n"
        "running() { [ -f \"$PIDFILE\" ] && kill -0 \"$(cat \"$PIDFILE\")\" 2>/dev/null; }\n"
        "case \"$1\" in\n"
        "  start) running && exit 0\n"
        "    sh -c 'trap \"exit 0\" TERM; while :; do sleep 0.2; done' >/dev/null 2>&1 "
        "</dev/null &\n"
        "    echo $! >\"$PIDFILE\" ;;\n"
        "  stop) while [ ! -f '" +
        root_.Path("/tmp/gate") +
        "' ]; do sleep 0.05; done\n"
        "    running && kill \"$(cat \"$PIDFILE\")\"; rm -f \"$PIDFILE\" ;;\n"
        "  status) running ;;\n"
        "esac\n";
    return p;
  }
  void Open() { root_.Write("/tmp/gate", ""); }

  std::string dir_, data_;
  TestPackage v1_, v2_;
};

TEST_F(RevisionApiTest, ListsTheKeptVersionRollsBackAndUndoesItAndDropsTheCopy) {
  Install(v1_, {"--run"});
  Install(v2_);
  ASSERT_EQ("migrated by 2.0\n", Notes());

  Json::Value entry = Entry();
  EXPECT_EQ("test-app", entry["id"].asString()) << entry;
  EXPECT_EQ("2.0", entry["version"].asString());
  ASSERT_EQ(1u, entry["kept"].size()) << entry;
  EXPECT_EQ("1.0", entry["kept"][0]["version"].asString());
  EXPECT_GT(entry["kept"][0]["replaced"].asInt64(), 1700000000);
  EXPECT_GT(entry["kept"][0]["bytes"].asUInt64(), 0u);
  EXPECT_FALSE(entry.isMember("rollback"));
  // Without an id, every package that has something to say.
  CgiAnswer all = Call("list", {});
  ASSERT_TRUE(all.Success()) << all.body;
  EXPECT_EQ(1u, all.Data()["packages"].size()) << all.body;

  CgiAnswer started = Call("rollback");
  ASSERT_TRUE(started.Success()) << started.body;
  EXPECT_EQ("@KIVOPKG_ROLLBACK_test-app", started.Data()["task_id"].asString());
  EXPECT_EQ("2.0", started.Data()["rollback"]["from_version"].asString()) << started.body;
  EXPECT_EQ("1.0", started.Data()["rollback"]["to_version"].asString());
  Json::Value end = RollbackEnd();
  ASSERT_EQ("success", end["state"].asString()) << end;
  EXPECT_EQ("1.0", end["version"].asString());
  EXPECT_NE(std::string::npos, end["message"].asString().find("was rolled back by admin to 1.0"))
      << end;
  EXPECT_EQ("test-app 1.0 running\n", Status());
  EXPECT_EQ("written by 1.0\n", Notes());
  Json::Value recorded = Newest("Revision.rollback");
  EXPECT_EQ("success", recorded["state"].asString()) << recorded;
  EXPECT_EQ("admin", recorded["actor"].asString());
  EXPECT_EQ("test-app", recorded["packages"][0].asString());

  // The version left is kept in turn: a second rollback undoes the first.
  entry = Entry();
  ASSERT_EQ(1u, entry["kept"].size()) << entry;
  EXPECT_EQ("2.0", entry["kept"][0]["version"].asString());
  ASSERT_TRUE(Call("rollback").Success());
  ASSERT_EQ("success", RollbackEnd()["state"].asString());
  EXPECT_EQ("test-app 2.0 running\n", Status());
  EXPECT_EQ("migrated by 2.0\n", Notes());

  CgiAnswer dropped = Call("drop");
  ASSERT_TRUE(dropped.Success()) << dropped.body;
  EXPECT_NE(std::string::npos, dropped.Data()["message"].asString().find("dropped test-app 1.0"))
      << dropped.body;
  EXPECT_EQ(0u, Entry()["kept"].size());
  EXPECT_EQ("success", Newest("Revision.drop")["state"].asString());
  EXPECT_EQ("test-app 2.0 running\n", Status());
}

// The request answers as soon as the worker runs; the worker goes on alone,
// any later request reads how far it is, a second rollback meanwhile is
// refused, and the outcome stays for a page that comes back.
TEST_F(RevisionApiTest, RollbackRunsInItsOwnProcessAndItsStateOutlivesTheRequest) {
  Install(v1_, {"--run"});
  Install(Gated(v2_));

  CgiAnswer started = Call("rollback");
  ASSERT_TRUE(started.Success()) << started.body;
  // 2.0 cannot stop until the gate opens: the rollback is under way.
  EXPECT_EQ("running", Entry()["rollback"]["state"].asString());
  EXPECT_EQ("running", Newest("Revision.rollback")["state"].asString());
  CgiAnswer again = Call("rollback");
  EXPECT_EQ(4611, again.Code()) << again.body;
  EXPECT_EQ("failure", Newest("Revision.rollback")["state"].asString());
  EXPECT_EQ("test-app 2.0 running\n", Status());

  Open();
  Json::Value end = RollbackEnd();
  EXPECT_EQ("success", end["state"].asString()) << end;
  EXPECT_EQ("test-app 1.0 running\n", Status());
  EXPECT_EQ("written by 1.0\n", Notes());
  // Read again later, the outcome is still there.
  EXPECT_EQ("success", Entry()["rollback"]["state"].asString());
}

TEST_F(RevisionApiTest, RefusalsSayWhyAndAreOnRecord) {
  Install(v1_);
  CgiAnswer none = Call("rollback");
  EXPECT_EQ(4610, none.Code()) << none.body;
  Json::Value recorded = Newest("Revision.rollback");
  EXPECT_EQ("failure", recorded["state"].asString()) << recorded;
  EXPECT_EQ(4610, recorded["code"].asInt());
  EXPECT_EQ(4610, Call("drop").Code());
  EXPECT_EQ(4610, Newest("Revision.drop")["code"].asInt());

  EXPECT_EQ(4614, Call("rollback", {{"id", "other-app"}}).Code());
  EXPECT_EQ(4614, Call("list", {{"id", "other-app"}}).Code());
  for (const char* bad : {"../test-app", "", "-x"}) {
    CgiAnswer a = Call("rollback", {{"id", bad}});
    EXPECT_EQ(120, a.Code()) << bad << ": " << a.body;
  }
  EXPECT_EQ(120, Call("rollback", {}).Code());
  EXPECT_EQ("test-app 1.0 stopped\n", Status());
  // Nothing to say of a package without kept versions, failures or rollbacks.
  EXPECT_EQ(0u, Call("list", {}).Data()["packages"].size());
}

TEST_F(RevisionApiTest, ListSaysWhichVersionAnAutomaticUpdateWillNotTryAgain) {
  Install(v1_);
  const std::string record = PackageRegistry::PublishedRecord("test-app");
  root_.Write("/usr/kivo/etc/packages/autoupdate-failures.json",
              "{\"test-app\": {\"version\": \"2.0\", \"time\": 1700000000, \"code\": 305,"
              " \"reason\": \"The upgrade to 2.0 failed its health check\", \"record\": \"" +
                  record + "\"}}");
  Json::Value failure = Entry()["autoupdate_failure"];
  EXPECT_EQ("2.0", failure["version"].asString()) << failure;
  EXPECT_EQ(1700000000, failure["time"].asInt64());
  EXPECT_EQ(305, failure["code"].asInt());
  EXPECT_EQ("The upgrade to 2.0 failed its health check", failure["reason"].asString());
  EXPECT_EQ(1u, Call("list", {}).Data()["packages"].size());

  // Once another version is published the failure no longer holds.
  Install(v2_);
  EXPECT_FALSE(Entry().isMember("autoupdate_failure"));
}

TEST_F(RevisionApiTest, OnlyAdministratorsMayAsk) {
  root_.AddAccount("guest", "guest-pw", {"users"});
  ApiClient guest("guest", "guest-pw");
  ASSERT_TRUE(guest.signed_in());
  EXPECT_EQ(105, guest.Call(kRevision, "list", 1, {}).Code());
  EXPECT_EQ(105, guest.Call(kRevision, "rollback", 1, {{"id", "test-app"}}).Code());
}

}  // namespace
