// The activity log on a root of its own: entries begun and finished, those
// of a killed process, the bounds, the filters and a damaged file.

#include "activity/activity_log.h"

#include <csignal>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "taskmgr/sqlite_api.h"
#include "testing/temp_root.h"

namespace {

using namespace KivoActivity;

class ActivityLogTest : public ::testing::Test {
 protected:
  // Records a finished operation `name` on `package` by `account`.
  void Add(const std::string& name, const std::string& package, const std::string& account,
           int code = 0) {
    Operation op;
    op.name = name;
    op.target["id"] = package;
    op.packages = {package};
    ASSERT_TRUE(log_.Record({account, kOriginWeb, "127.0.0.1"}, op, {code, "words"}));
  }
  Json::Value List(const Filter& f = {}, long long offset = 0, int limit = kMaxPage) {
    Json::Value entries;
    long long total = -1;
    EXPECT_TRUE(log_.List(f, offset, limit, &entries, &total));
    total_ = total;
    return entries;
  }
  // Runs `sql` on the log file directly, as nothing in the product would.
  void Poke(const std::string& sql) {
    sqlite3* db = nullptr;
    ASSERT_EQ(SQLITE_OK, NVX::Sqlite()->open_v2(ActivityLog::Path().c_str(), &db,
                                                SQLITE_OPEN_READWRITE, nullptr));
    EXPECT_EQ(SQLITE_OK, NVX::Sqlite()->exec(db, sql.c_str(), nullptr, nullptr, nullptr));
    NVX::Sqlite()->close(db);
  }
  // A child process that begins `name` and then waits to be killed; its pid.
  pid_t BeginInChild(const std::string& name) {
    int ready[2];
    EXPECT_EQ(0, pipe(ready));
    pid_t pid = fork();
    if (pid == 0) {
      ActivityLog log;
      Operation op;
      op.name = name;
      char ok = log.Begin({"root", kOriginKivoctl, ""}, op) > 0 ? '1' : '0';
      if (write(ready[1], &ok, 1) != 1) _exit(1);
      pause();
      _exit(0);
    }
    close(ready[1]);
    char ok = 0;
    EXPECT_EQ(1, read(ready[0], &ok, 1));
    EXPECT_EQ('1', ok);
    close(ready[0]);
    return pid;
  }

  TempRoot root_;
  ActivityLog log_;
  long long total_ = 0;
};

TEST_F(ActivityLogTest, EntriesComeNewestFirstWithTheirOutcome) {
  Add("Control.start", "alpha", "admin");
  Add("Control.stop", "beta", "ops", 4501);
  Json::Value e = List();
  ASSERT_EQ(2u, e.size());
  EXPECT_EQ(2, total_);
  EXPECT_EQ("Control.stop", e[0]["operation"].asString());
  EXPECT_EQ("failure", e[0]["state"].asString());
  EXPECT_EQ(4501, e[0]["code"].asInt());
  EXPECT_EQ("beta", e[0]["packages"][0].asString());
  EXPECT_EQ("success", e[1]["state"].asString());
  EXPECT_EQ("admin", e[1]["actor"].asString());
  EXPECT_EQ("web", e[1]["origin"].asString());
  EXPECT_EQ("127.0.0.1", e[1]["address"].asString());
  EXPECT_EQ("alpha", e[1]["target"]["id"].asString());
  EXPECT_GE(e[1]["duration_ms"].asInt64(), 0);
}

TEST_F(ActivityLogTest, TheFileIsForItsOwnerOnly) {
  Add("Control.start", "alpha", "admin");
  struct stat st;
  ASSERT_EQ(0, stat(ActivityLog::Path().c_str(), &st));
  EXPECT_EQ(0600u, st.st_mode & 0777);
}

TEST_F(ActivityLogTest, FiltersAndPagesSelect) {
  for (int i = 0; i < 5; ++i) Add("Control.start", i % 2 ? "alpha" : "beta", "admin");
  Add("Setting.set", "gamma", "ops", 120);
  Filter by_package;
  by_package.package = "alpha";
  EXPECT_EQ(2u, List(by_package).size());
  Filter by_account;
  by_account.account = "ops";
  EXPECT_EQ("Setting.set", List(by_account)[0]["operation"].asString());
  Filter failures;
  failures.state = kStateFailure;
  EXPECT_EQ(1u, List(failures).size());
  Filter op;
  op.operation = "Control.start";
  Json::Value page = List(op, 1, 2);
  EXPECT_EQ(5, total_);
  ASSERT_EQ(2u, page.size());
  EXPECT_GT(page[0]["id"].asInt64(), page[1]["id"].asInt64());
  Filter hostile;
  hostile.package = "alpha' OR 1=1 --";
  EXPECT_EQ(0u, List(hostile).size());
  Filter future;
  future.since_ms = NowMs() + 60000;
  EXPECT_EQ(0u, List(future).size());
}

TEST_F(ActivityLogTest, AKilledProcessLeavesAnUnfinishedEntry) {
  pid_t pid = BeginInChild("Control.start");
  Json::Value e = List();
  ASSERT_EQ(1u, e.size());
  EXPECT_EQ("running", e[0]["state"].asString());
  EXPECT_TRUE(e[0]["ended"].isNull());
  kill(pid, SIGKILL);
  waitpid(pid, nullptr, 0);
  e = List();
  EXPECT_EQ("unfinished", e[0]["state"].asString());
  EXPECT_TRUE(e[0]["ended"].isNull());
  Filter unfinished;
  unfinished.state = kStateUnfinished;
  EXPECT_EQ(1u, List(unfinished).size());
}

TEST_F(ActivityLogTest, TheOldestAreDroppedBeyondTheCount) {
  root_.Write("/etc/kivo/activity.conf", "max_entries=\"3\"\n");
  for (int i = 0; i < 5; ++i) Add("Control.start", "p" + std::to_string(i), "admin");
  Json::Value e = List();
  ASSERT_EQ(3u, e.size());
  EXPECT_EQ("p4", e[0]["packages"][0].asString());
  EXPECT_EQ("p2", e[2]["packages"][0].asString());
  Filter gone;
  gone.package = "p0";
  EXPECT_EQ(0u, List(gone).size());
}

TEST_F(ActivityLogTest, EntriesOlderThanTheAgeAreDropped) {
  root_.Write("/etc/kivo/activity.conf", "max_age_days=\"2\"\n");
  Add("Control.start", "old", "admin");
  Add("Control.start", "recent", "admin");
  const long long day = 86400000LL;
  Poke("UPDATE activity SET started = started - " + std::to_string(3 * day) + " WHERE id = 1;" +
       "UPDATE activity SET started = started - " + std::to_string(day) + " WHERE id = 2;");
  Add("Control.stop", "new", "admin");
  Json::Value e = List();
  ASSERT_EQ(2u, e.size());
  EXPECT_EQ("recent", e[1]["packages"][0].asString());
}

TEST_F(ActivityLogTest, ADamagedFileIsSetAsideAndTheLogStartsAfresh) {
  root_.Write("/var/lib/kivo/activity.db", std::string(4096, 'x'));
  Add("Control.start", "alpha", "admin");
  EXPECT_EQ(1u, List().size());
  EXPECT_EQ(1, CountEntries(root_.Path("/var/lib/kivo"), "activity.db.damaged-"));
}

}  // namespace
