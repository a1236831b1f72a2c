// The watchdog (`kivoctl watchdog`) through the real tool on a temporary
// root, with packages built by the project's builder: a package whose
// service is killed is started again; one that keeps dying is marked
// crashed with the reason and its log, and the administrator's start clears
// the mark; a package the administrator stops stays stopped whichever of
// the two acts first; a package under an install, upgrade or uninstall is
// left alone. Scripts wait at gate files, so each race is opened wide and
// closed by the test, never by a sleep.

#include <atomic>
#include <csignal>
#include <fcntl.h>
#include <functional>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

#include <gtest/gtest.h>

#include "activity/activity_log.h"
#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "klibc/process.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"
#include "testing/admin_api_test.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

constexpr char kId[] = "test-app";

// A daemon tracked by its pid file. Its start waits at the gate when
// slow-start exists, its stop (after the daemon is gone) when slow-stop
// exists; a gate opens when go exists (at most 30 s). The gate files are in
// the package's data folder, the one folder its scripts may write.
const char kGatedDaemon[] =
    "PIDFILE=\"$KIVO_PKG_VAR/daemon.pid\"\n"
    "running() { [ -f \"$PIDFILE\" ] && kill -0 \"$(cat \"$PIDFILE\")\" 2>/dev/null; }\n"
    "gate() { touch \"$KIVO_PKG_VAR/$1\"; n=0\n"
    "  while [ ! -f \"$KIVO_PKG_VAR/go\" ] && [ $n -lt 300 ]; do sleep 0.1; n=$((n+1)); done; }\n"
    "case \"$1\" in\n"
    "  start) running && exit 0\n"
    "    if [ -f \"$KIVO_PKG_VAR/slow-start\" ]; then gate starting; fi\n"
    "    sh -c 'trap \"exit 0\" TERM; while :; do sleep 0.2; done' >/dev/null 2>&1 </dev/null &\n"
    "    echo $! >\"$PIDFILE\" ;;\n"
    "  stop) running && kill \"$(cat \"$PIDFILE\")\"; rm -f \"$PIDFILE\"\n"
    "    if [ -f \"$KIVO_PKG_VAR/slow-stop\" ]; then gate stopping; fi ;;\n"
    "  status) running ;;\n"
    "esac\n";

// A service that dies as soon as it starts, saying why in its log.
const char kDyingDaemon[] =
    "case \"$1\" in\n"
    "  start) echo \"fatal: cannot open port 8080\" >>\"$KIVO_PKG_VAR/app.log\"\n"
    "    sh -c 'exit 1' </dev/null >/dev/null 2>&1 &\n"
    "    echo $! >\"$KIVO_PKG_VAR/daemon.pid\" ;;\n"
    "  stop) rm -f \"$KIVO_PKG_VAR/daemon.pid\" ;;\n"
    "  status) exit 1 ;;\n"
    "esac\n";

// Waits in a scripted gate: the script writes $GATE in its data folder when
// it reaches it.
const char kGateScript[] =
    "touch \"$KIVO_PKG_VAR/$GATE\"; n=0\n"
    "while [ ! -f \"$KIVO_PKG_VAR/go\" ] && [ $n -lt 300 ]; do sleep 0.1; n=$((n+1)); done\n";

TestPackage Gated(const std::string& version = "1.0") {
  TestPackage p;
  p.id = kId;
  p.version = version;
  p.daemon = false;
  p.info = {{"pidfile", "daemon.pid"}};
  p.scripts = {{"start-stop-status", kGatedDaemon}};
  return p;
}

class WatchdogTest : public AdminApiTest {
 protected:
  void SetUp() override {
    packages_ = root_.Path("/packages");
    Trust(1);  // the test's packages are unsigned
    // Room for the administrator's stop to wait out a watchdog's start.
    root_.Write("/etc/kivo/pkgtool.conf", "lock_wait=\"30\"\n");
    Settings("interval_seconds=\"1\"\nmax_restarts=\"3\"\nrestart_delay_seconds=\"1\"\n");
  }

  void TearDown() override {
    Open();
    if (watchdog_ > 0) {
      EXPECT_EQ(0, StopWatchdog());
    }
    StopInstalledPackages();
  }

  void Settings(const std::string& text) { root_.Write("/etc/kivo/watchdog.conf", text); }
  // A gate file in the package's data folder.
  std::string Gate(const std::string& name) { return Record("var/" + name); }
  void Touch(const std::string& name) {
    ASSERT_TRUE(KIVOWriteFileAtomic(Gate(name), "", SyncToDisk::No)) << Gate(name);
  }
  bool Reached(const std::string& name) { return access(Gate(name).c_str(), F_OK) == 0; }
  bool Exists(const std::string& fixed) { return access(root_.Path(fixed).c_str(), F_OK) == 0; }
  std::string Record(const std::string& member) {
    return root_.Path(std::string("/var/packages/") + kId + "/" + member);
  }

  int Install(const TestPackage& p, std::vector<std::string> options = {}) {
    std::vector<std::string> args = {"install", p.Build(packages_)};
    args.insert(args.end(), options.begin(), options.end());
    return Kivoctl(args, &out_);
  }

  std::string Status() {
    std::string out;
    Kivoctl({"status", kId}, &out);
    return out;
  }

  pid_t DaemonPid() {
    return static_cast<pid_t>(std::atol(FileText(Record("var/daemon.pid")).c_str()));
  }

  void KillDaemon() {
    const pid_t pid = DaemonPid();
    ASSERT_GT(pid, 0);
    ASSERT_EQ(0, kill(pid, SIGKILL));
    // Ended, whether or not it has been reaped yet.
    ASSERT_TRUE(WaitFor([&] { return KLIBCProcAlive(pid) == 0; }, 10));
  }

  // Polls `done` every 50 ms for at most `seconds`.
  static bool WaitFor(const std::function<bool()>& done, int seconds) {
    for (int i = 0; i < seconds * 20; ++i) {
      if (done()) return true;
      usleep(50 * 1000);
    }
    return done();
  }

  // The watchdog as a service, its output into tmp/watchdog.out.
  void StartWatchdog() {
    const std::string program = BuildDir() + "/bin/kivoctl";
    const std::string log = root_.Path("/tmp/watchdog.out");
    watchdog_ = fork();
    if (watchdog_ == 0) {
      int fd = open(log.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
      dup2(fd, STDOUT_FILENO);
      dup2(fd, STDERR_FILENO);
      execl(program.c_str(), program.c_str(), "watchdog", nullptr);
      _exit(127);
    }
    ASSERT_GT(watchdog_, 0);
  }

  // Ends the service with SIGTERM, as systemd does; its exit status.
  int StopWatchdog() {
    kill(watchdog_, SIGTERM);
    int status = 0;
    waitpid(watchdog_, &status, 0);
    watchdog_ = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  }

  int Once() { return Kivoctl({"watchdog", "--once"}, &out_); }

  // The activity log's entries of the package by the watchdog, newest first.
  Json::Value WatchdogEntries() {
    KivoActivity::ActivityLog log;
    KivoActivity::Filter filter;
    filter.package = kId;
    Json::Value entries, mine(Json::arrayValue);
    long long total = 0;
    EXPECT_TRUE(log.List(filter, 0, KivoActivity::kMaxPage, &entries, &total));
    for (const Json::Value& e : entries) {
      if (e["origin"] == KivoActivity::kOriginWatchdog) mine.append(e);
    }
    return mine;
  }

  // Whether an entry of `operation` on the package is under way.
  bool Begun(const std::string& operation) {
    KivoActivity::ActivityLog log;
    KivoActivity::Filter filter;
    filter.package = kId;
    filter.operation = operation;
    filter.state = KivoActivity::kStateRunning;
    Json::Value entries;
    long long total = 0;
    return log.List(filter, 0, 1, &entries, &total) && total > 0;
  }

  Json::Value WatchdogView() {
    CgiAnswer answer = client().Call("KIVO.Core.Package.Watchdog", "list", 1);
    EXPECT_TRUE(answer.Success()) << answer.body;
    for (const Json::Value& p : answer.Data()["packages"]) {
      if (p["id"] == kId) return p;
    }
    return Json::Value();
  }

  // A kivoctl command run beside the test. Finish opens the gates and waits
  // for it; so does the destructor, for a test that ended early.
  class Beside {
   public:
    Beside(WatchdogTest* test, std::vector<std::string> args)
        : test_(test), thread_([this, args] {
            status_ = Kivoctl(args, &out);
            done_ = true;
          }) {}
    ~Beside() { static_cast<void>(Finish()); }
    Beside(const Beside&) = delete;
    Beside& operator=(const Beside&) = delete;

    int Finish() {
      if (thread_.joinable()) {
        test_->Open();
        thread_.join();
      }
      return status_;
    }

    // Whether the command has ended (its gates were not opened for it).
    bool Done() const { return done_; }

    std::string out;

   private:
    WatchdogTest* test_;
    int status_ = -1;
    std::atomic<bool> done_{false};
    std::thread thread_;
  };

  // Opens the gates, while the package is installed.
  void Open() {
    if (PackageRegistry::IsInstalled(kId)) {
      static_cast<void>(KIVOWriteFileAtomic(Gate("go"), "", SyncToDisk::No));
    }
  }

  std::string packages_, out_;
  pid_t watchdog_ = -1;
};

TEST_F(WatchdogTest, KilledServiceIsStartedAgainAndTheRestartIsOnRecord) {
  ASSERT_EQ(0, Install(Gated(), {"--run"})) << out_;
  const pid_t first = DaemonPid();
  StartWatchdog();
  KillDaemon();
  ASSERT_TRUE(
      WaitFor([&] { return DaemonPid() != first && Status() == "test-app 1.0 running\n"; }, 20))
      << Status() << FileText(root_.Path("/tmp/watchdog.out"));
  EXPECT_EQ(0, StopWatchdog());
  EXPECT_NE(
      std::string::npos,
      FileText(root_.Path("/tmp/watchdog.out")).find("restarted test-app (1 in the last hour)"));

  const Json::Value entries = WatchdogEntries();
  ASSERT_EQ(1u, entries.size()) << entries;
  EXPECT_EQ("restart", entries[0]["operation"].asString());
  EXPECT_EQ("watchdog", entries[0]["actor"].asString());
  EXPECT_EQ("success", entries[0]["state"].asString());
  EXPECT_EQ("1.0", entries[0]["target"]["version"].asString());
  EXPECT_EQ(1, WatchdogView()["restarts_last_hour"].asInt());
  EXPECT_TRUE(WatchdogView()["crashed"].isNull());
}

TEST_F(WatchdogTest, PackageThatKeepsDyingIsMarkedCrashedAndTheAdministratorsStartClearsIt) {
  TestPackage p;
  p.id = kId;
  p.daemon = false;
  p.info = {{"pidfile", "daemon.pid"}, {"logfile", "app.log"}};
  p.scripts = {{"start-stop-status", kDyingDaemon}};
  ASSERT_EQ(0, Install(p, {"--run"})) << out_;
  StartWatchdog();
  ASSERT_TRUE(WaitFor([&] { return Exists(std::string("/var/packages/") + kId + "/crashed"); }, 40))
      << FileText(root_.Path("/tmp/watchdog.out"));
  // Given up on, it is no longer started, however many checks pass.
  const std::string restarts = FileText(Record("restarts"));
  ASSERT_EQ(0, Once()) << out_;
  EXPECT_EQ(restarts, FileText(Record("restarts")));
  EXPECT_EQ(0, StopWatchdog());

  // Three restarts, each waiting longer than the one before: 1 s, then 2 s.
  Json::Value history;
  ASSERT_TRUE(KIVOParseJson(restarts, &history)) << restarts;
  ASSERT_EQ(3u, history["restarts"].size()) << restarts;
  const Json::Value& r = history["restarts"];
  EXPECT_GE(r[1]["time"].asInt64() - r[0]["time"].asInt64(), 1000) << restarts;
  EXPECT_GE(r[2]["time"].asInt64() - r[1]["time"].asInt64(), 2000) << restarts;

  const Json::Value view = WatchdogView();
  ASSERT_TRUE(view["crashed"].isObject()) << view;
  EXPECT_EQ(3, view["crashed"]["restarts"].asInt());
  EXPECT_EQ("it stopped running again after each of 3 restarts within an hour",
            view["crashed"]["reason"].asString());
  EXPECT_NE(std::string::npos, view["crashed"]["log"].asString().find("cannot open port 8080"));
  EXPECT_EQ(3, view["restarts_last_hour"].asInt());

  const Json::Value entries = WatchdogEntries();
  ASSERT_EQ(4u, entries.size()) << entries;
  EXPECT_EQ("give-up", entries[0]["operation"].asString());
  EXPECT_EQ(PKG_ERR_CRASHED, entries[0]["code"].asInt());
  EXPECT_EQ("stopped trying after 3 restarts: " + view["crashed"]["reason"].asString(),
            entries[0]["words"].asString());
  for (int i = 1; i < 4; ++i) EXPECT_EQ("restart", entries[i]["operation"].asString());

  // The administrator starts it again: a fresh count, no mark.
  ASSERT_EQ(0, Kivoctl({"start", kId}, &out_)) << out_;
  EXPECT_FALSE(Exists(std::string("/var/packages/") + kId + "/crashed"));
  EXPECT_FALSE(Exists(std::string("/var/packages/") + kId + "/restarts"));
  EXPECT_TRUE(WatchdogView()["crashed"].isNull());
  EXPECT_EQ(0, WatchdogView()["restarts_last_hour"].asInt());
}

// The stop holds the lock, its daemon gone and the package still marked to
// run, while the watchdog checks: the watchdog leaves it for the next
// check, which finds it stopped.
TEST_F(WatchdogTest, PackageStoppedWhileTheWatchdogChecksStaysStopped) {
  ASSERT_EQ(0, Install(Gated(), {"--run"})) << out_;
  Touch("slow-stop");
  Beside stop(this, {"stop", kId});
  ASSERT_TRUE(WaitFor([&] { return Reached("stopping"); }, 20));
  ASSERT_TRUE(Exists(std::string("/var/packages/") + kId + "/enabled"));
  EXPECT_EQ(0, Once()) << out_;
  EXPECT_NE(std::string::npos,
            out_.find("skipped test-app: another package operation is under way"))
      << out_;
  ASSERT_EQ(0, stop.Finish()) << stop.out;
  EXPECT_EQ(0, Once()) << out_;
  EXPECT_EQ("test-app 1.0 stopped\n", Status());
  EXPECT_EQ(0u, WatchdogEntries().size());
}

// The watchdog's start holds the lock when the administrator stops the
// package: the stop waits for it and wins.
TEST_F(WatchdogTest, StopDuringTheWatchdogsStartEndsStopped) {
  ASSERT_EQ(0, Install(Gated(), {"--run"})) << out_;
  KillDaemon();
  Touch("slow-start");
  Beside watchdog(this, {"watchdog", "--once"});
  ASSERT_TRUE(WaitFor([&] { return Reached("starting"); }, 20));
  Beside stop(this, {"stop", kId});
  // The stop is under way (its entry is begun) and waits for the lock that
  // the start holds: it cannot end while the start waits at its gate.
  ASSERT_TRUE(WaitFor([&] { return Begun("Control.stop"); }, 20));
  EXPECT_FALSE(WaitFor([&] { return stop.Done(); }, 2)) << stop.out;
  EXPECT_EQ(0, watchdog.Finish()) << watchdog.out;
  EXPECT_NE(std::string::npos, watchdog.out.find("restarted test-app")) << watchdog.out;
  ASSERT_EQ(0, stop.Finish()) << stop.out;
  EXPECT_EQ("test-app 1.0 stopped\n", Status());
  EXPECT_EQ(0, Once()) << out_;
  EXPECT_EQ("test-app 1.0 stopped\n", Status());
}

// An upgrade and an uninstall stop the package and hold the lock while
// their scripts run: the watchdog leaves the package alone.
TEST_F(WatchdogTest, PackageUnderAnUpgradeOrUninstallIsLeftAlone) {
  ASSERT_EQ(0, Install(Gated(), {"--run"})) << out_;
  TestPackage v2 = Gated("2.0");
  v2.scripts["preupgrade"] = std::string("GATE=upgrading\n") + kGateScript;
  const std::vector<std::pair<std::vector<std::string>, const char*>> kOperations = {
      {{"install", v2.Build(packages_)}, "upgrading"},  // in preupgrade
      {{"uninstall", kId}, "stopping"},                 // in the stop before preuninst
  };
  for (const auto& [args, gate] : kOperations) {
    SCOPED_TRACE(args[0]);
    unlink(Gate("go").c_str());
    if (args[0] == "uninstall") Touch("slow-stop");
    Beside operation(this, args);
    ASSERT_TRUE(WaitFor([&] { return Reached(gate); }, 20));
    // The package is meant to run and its service is down.
    ASSERT_TRUE(Exists(std::string("/var/packages/") + kId + "/enabled"));
    ASSERT_FALSE(KLIBCProcAlive(DaemonPid()));
    EXPECT_EQ(0, Once()) << out_;
    EXPECT_NE(std::string::npos, out_.find("skipped test-app")) << out_;
    ASSERT_EQ(0, operation.Finish()) << operation.out;
  }
  EXPECT_FALSE(PackageRegistry::IsInstalled(kId));
  EXPECT_EQ(0u, WatchdogEntries().size());
}

TEST_F(WatchdogTest, SettingsThatBreakARuleAreRefusedWhole) {
  const std::pair<const char*, const char*> kBad[] = {
      {"interval_seconds=\"0\"\n", "interval_seconds takes a whole number from 1 to 3600"},
      {"max_restarts=\"5x\"\n", "max_restarts takes a whole number from 1 to 20"},
      {"restart_delay_seconds=\"-1\"\n", "restart_delay_seconds takes a whole number"},
      {"interval_seconds=\"5\"\nrestart=\"3\"\n", "unknown setting restart"},
      {"max_restarts=\"10\"\nrestart_delay_seconds=\"60\"\n", "the watchdog would never give up"},
  };
  for (const auto& [text, words] : kBad) {
    Settings(text);
    EXPECT_EQ(1, Once()) << text;
    EXPECT_NE(std::string::npos, out_.find(words)) << out_;
    EXPECT_NE(std::string::npos, out_.find("[331]")) << out_;
  }
  Settings("# defaults but one\ninterval_seconds=\"60\"\n");
  EXPECT_EQ(0, Once()) << out_;
  unlink(root_.Path("/etc/kivo/watchdog.conf").c_str());
  EXPECT_EQ(0, Once()) << out_;
}

TEST_F(WatchdogTest, OnlyAdministratorsReadWhatTheWatchdogDid) {
  root_.AddAccount("guest", "guest-pw", {"users"});
  ApiClient guest("guest", "guest-pw");
  ASSERT_TRUE(guest.signed_in());
  CgiAnswer answer = guest.Call("KIVO.Core.Package.Watchdog", "list", 1);
  EXPECT_FALSE(answer.Success()) << answer.body;
  ASSERT_EQ(0, Install(Gated())) << out_;
  EXPECT_EQ(0, WatchdogView()["restarts_last_hour"].asInt());
}

}  // namespace
