// Packages run as accounts of their own, confined with Landlock: hostile
// packages built by the project's tool try to reach what is not theirs on a
// temporary root (its files, another package's port), and the tool's
// accounts, records and logs, and the web API, say what was applied. Needs
// root (to change users) and a kernel with Landlock; skips with the reason
// otherwise.

#include <algorithm>
#include <chrono>
#include <grp.h>
#include <pwd.h>
#include <set>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <thread>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "pkgtool/package_account.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"
#include "testing/admin_api_test.h"
#include "testing/gpg_keys.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

#include <arpa/inet.h>
#include <linux/landlock.h>
#include <netinet/in.h>

namespace {

// What stops a test from running here, "" when nothing does.
std::string MissingForConfinement() {
  if (geteuid() != 0) return "needs root to run packages as their own accounts";
  long abi = syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
  if (abi < 1) return "the kernel offers no Landlock";
  return "";
}

// One try at reaching something: its name and the command, in sh.
const char kAttemptScript[] =
    "# attempt NAME CMD...: records in $R whether CMD was let through.\n"
    "attempt() {\n"
    "  name=$1; shift\n"
    "  if \"$@\"; then echo \"$name ALLOWED\" >> \"$R\"\n"
    "  else echo \"$name denied\" >> \"$R\"; echo \"intruder: $name was denied\" >&2; fi\n"
    "}\n"
    "ptrace_attach() {\n"
    "  python3 -c 'import ctypes,sys; libc=ctypes.CDLL(None, use_errno=True); "
    "sys.exit(0 if libc.ptrace(16, int(sys.argv[1]), 0, 0) == 0 else 1)' \"$1\"\n"
    "}\n"
    "write_into() { echo intruder >> \"$1\"; }\n"
    "try_everything() {\n"
    "  V=\"$KIVO_ROOT/volume1/@appdata/victim\"\n"
    "  attempt shadow cat \"$KIVO_ROOT/etc/shadow\"\n"
    "  attempt sessions cat \"$KIVO_ROOT/run/kivo/sessions/secret-session\"\n"
    "  attempt keyring cat \"$KIVO_ROOT/usr/kivo/etc/packages/gnupg/pubring.kbx\"\n"
    "  attempt registry write_into \"$KIVO_ROOT/var/packages/planted\"\n"
    "  attempt other-data write_into \"$V/planted\"\n"
    "  attempt other-data-read cat \"$V/secret.txt\"\n"
    "  attempt settings write_into \"$KIVO_ROOT/etc/kivoinfo.conf\"\n"
    "  attempt payload write_into \"$KIVO_PKG_DEST/bin/attempt.sh\"\n"
    "  ln -sfn \"$KIVO_ROOT/etc/shadow\" \"$KIVO_PKG_VAR/to-shadow\"\n"
    "  ln -sfn \"$KIVO_ROOT/run/kivo/sessions\" \"$KIVO_PKG_VAR/to-sessions\"\n"
    "  ln -sfn \"$V\" \"$KIVO_PKG_VAR/to-victim\"\n"
    "  ln -sfn \"$KIVO_ROOT/var/packages\" \"$KIVO_PKG_VAR/to-registry\"\n"
    "  attempt link-shadow cat \"$KIVO_PKG_VAR/to-shadow\"\n"
    "  attempt link-sessions cat \"$KIVO_PKG_VAR/to-sessions/secret-session\"\n"
    "  attempt link-other-data write_into \"$KIVO_PKG_VAR/to-victim/planted\"\n"
    "  attempt link-registry write_into \"$KIVO_PKG_VAR/to-registry/planted\"\n"
    "  VICTIM=$(cat \"$KIVO_PKG_VAR/victim.pid\")\n"
    "  attempt signal kill -0 \"$VICTIM\"\n"
    "  if command -v python3 >/dev/null; then attempt ptrace ptrace_attach \"$VICTIM\"; fi\n"
    "  echo mine > \"$KIVO_PKG_VAR/own.txt\" && [ \"$(cat \"$KIVO_PKG_VAR/own.txt\")\" = mine ] "
    "&&\n"
    "    echo 'own-data ok' >> \"$R\"\n"
    "  echo t > \"$TMPDIR/t\" && [ \"$(cat \"$TMPDIR/t\")\" = t ] && echo 'tmp ok' >> \"$R\"\n"
    "  [ -n \"$(cat \"$KIVO_PKG_DEST/bin/attempt.sh\")\" ] && echo 'payload-read ok' >> \"$R\"\n"
    "  echo \"uid $(id -u)\" >> \"$R\"\n"
    "  echo done >> \"$R\"\n"
    "}\n";

// The service: tries everything once, then runs until it is told to stop.
const char kServiceScript[] =
    ". \"$KIVO_PKG_DEST/bin/attempt.sh\"\n"
    "R=\"$KIVO_PKG_VAR/service-report\"\n"
    "try_everything\n"
    "trap 'exit 0' TERM\n"
    "while :; do sleep 0.2; done\n";

const char kStartStop[] =
    "PIDFILE=\"$KIVO_PKG_VAR/daemon.pid\"\n"
    "running() { [ -f \"$PIDFILE\" ] && kill -0 \"$(cat \"$PIDFILE\")\" 2>/dev/null; }\n"
    "case \"$1\" in\n"
    "  start) running && exit 0\n"
    "    sh \"$KIVO_PKG_DEST/bin/service.sh\" >/dev/null 2>&1 </dev/null &\n"
    "    echo $! >\"$PIDFILE\" ;;\n"
    "  stop) running && kill \"$(cat \"$PIDFILE\")\"; rm -f \"$PIDFILE\" ;;\n"
    "  status) running ;;\n"
    "esac\n";

// The names of `report`'s lines that end in `word`.
std::vector<std::string> LinesEndingIn(const std::string& report, const std::string& word) {
  std::vector<std::string> names;
  size_t start = 0;
  while (start < report.size()) {
    size_t end = report.find('\n', start);
    if (end == std::string::npos) end = report.size();
    std::string line = report.substr(start, end - start);
    if (line.size() > word.size() + 1 &&
        line.compare(line.size() - word.size(), word.size(), word) == 0) {
      names.push_back(line.substr(0, line.size() - word.size() - 1));
    }
    start = end + 1;
  }
  return names;
}

// A service that listens on 127.0.0.1:<port> (0: any free port, written to
// <var>/port) and answers each connection with its name; started by
// `serve.py PORT VAR NAME`, it returns once it listens (or could not).
const char kServePy[] =
    "import errno, os, socket, sys\n"
    "port, var, name = int(sys.argv[1]), sys.argv[2], sys.argv[3]\n"
    "log = open(os.path.join(var, 'service.log'), 'a')\n"
    "s = socket.socket(socket.AF_INET, socket.SOCK_STREAM)\n"
    "try:\n"
    "    s.bind(('127.0.0.1', port))\n"
    "    s.listen(16)\n"
    "except OSError as e:\n"
    "    msg = '%s: cannot bind 127.0.0.1:%d: %s (%s)' % (name, port, os.strerror(e.errno),\n"
    "                                                  errno.errorcode.get(e.errno, '?'))\n"
    "    log.write(msg + '\\n')\n"
    "    log.close()\n"
    "    print(msg, file=sys.stderr)\n"
    "    sys.exit(1)\n"
    "bound = s.getsockname()[1]\n"
    "log.write('%s: listening on 127.0.0.1:%d\\n' % (name, bound))\n"
    "log.flush()\n"
    "with open(os.path.join(var, 'port.tmp'), 'w') as f:\n"
    "    f.write(str(bound))\n"
    "os.rename(os.path.join(var, 'port.tmp'), os.path.join(var, 'port'))\n"
    "pid = os.fork()\n"
    "if pid > 0:\n"
    "    with open(os.path.join(var, 'daemon.pid'), 'w') as f:\n"
    "        f.write(str(pid))\n"
    "    os._exit(0)\n"
    "os.setsid()\n"
    "null = os.open(os.devnull, os.O_RDWR)\n"
    "for fd in (0, 1, 2):\n"
    "    os.dup2(null, fd)\n"
    "while True:\n"
    "    c, _ = s.accept()\n"
    "    c.sendall((name + '\\n').encode())\n"
    "    c.close()\n";

// Starts serve.py on the port its install was given (wizard value "port",
// none: any free port).
const char kServeStartStop[] =
    "PIDFILE=\"$KIVO_PKG_VAR/daemon.pid\"\n"
    "running() { [ -f \"$PIDFILE\" ] && kill -0 \"$(cat \"$PIDFILE\")\" 2>/dev/null; }\n"
    "case \"$1\" in\n"
    "  start) running && exit 0\n"
    "    port=$(cat \"$KIVO_PKG_VAR/wanted-port\" 2>/dev/null || echo 0)\n"
    "    exec /usr/bin/python3 \"$KIVO_PKG_DEST/bin/serve.py\" \"$port\" \"$KIVO_PKG_VAR\" "
    "\"$KIVO_PKG_NAME\" ;;\n"
    "  stop) running && kill \"$(cat \"$PIDFILE\")\"; rm -f \"$PIDFILE\" ;;\n"
    "  status) running ;;\n"
    "esac\n";

// The first line a TCP server on 127.0.0.1:`port` answers, "" when none
// answers.
std::string FirstLineAt(int port) {
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return "";
  struct sockaddr_in addr = {};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(static_cast<uint16_t>(port));
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  std::string line;
  if (connect(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) == 0) {
    char c;
    while (read(fd, &c, 1) == 1 && c != '\n') line += c;
  }
  close(fd);
  return line;
}

class ConfinementTest : public AdminApiTest {
 protected:
  void SetUp() override {
    missing_ = MissingForConfinement();
    if (!missing_.empty()) GTEST_SKIP() << "skipped: " << missing_;
    root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"1\"\n");
    dir_ = root_.Path("/tmp/packages");
    ASSERT_EQ(0, KIVOFSMkdirP(dir_.c_str()));
  }
  void TearDown() override {
    if (missing_.empty()) StopInstalledPackages();
  }

  std::string Build(const TestPackage& p) { return p.Build(dir_); }

  // The account line of the package `id` in the root's etc/passwd, "" for
  // none.
  std::string AccountLine(const std::string& id) {
    std::string passwd = FileText(root_.Path("/etc/passwd"));
    size_t at = passwd.find(":kivo package " + id + ":");
    if (at == std::string::npos) return "";
    size_t start = passwd.rfind('\n', at);
    start = start == std::string::npos ? 0 : start + 1;
    return passwd.substr(start, passwd.find('\n', at) - start);
  }

  // Takes away the account of `id` and its record, as of a package
  // installed before packages had accounts.
  void ForgetAccount(const std::string& id) {
    const std::string line = AccountLine(id);
    ASSERT_NE("", line);
    const std::string name = line.substr(0, line.find(':'));
    for (const char* file : {"/etc/passwd", "/etc/group"}) {
      std::string text = FileText(root_.Path(file));
      const size_t at = text.find(name + ":x:");
      ASSERT_NE(std::string::npos, at) << file;
      text.erase(at, text.find('\n', at) - at + 1);
      root_.Write(file, text);
    }
    ASSERT_EQ(0, unlink(root_.Path("/var/packages/" + id + "/confinement").c_str()));
  }

  Json::Value Confinement(const std::string& id) {
    Json::Value record;
    EXPECT_TRUE(
        KIVOParseJson(FileText(root_.Path("/var/packages/" + id + "/confinement")), &record))
        << id;
    return record;
  }

  // Waits (at most 20 s) for `path` to hold a line "done".
  std::string WaitForReport(const std::string& path) {
    for (int i = 0; i < 200; ++i) {
      std::string text = FileText(path);
      if (text.find("done\n") != std::string::npos) return text;
      std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    return FileText(path);
  }

  std::string missing_;
  std::string dir_;
  std::string out_;
};

TEST(PackageAccountName, MapsIdsToValidDistinctNames) {
  EXPECT_EQ("pkg-demo", PMSPackageAccountName("demo", 0));
  EXPECT_EQ("pkg-web.server_2-x", PMSPackageAccountName("web.server_2-x", 0));
  const std::string upper = PMSPackageAccountName("Demo", 0);
  const std::string plus = PMSPackageAccountName("g++", 0);
  const std::string longest = PMSPackageAccountName(std::string(64, 'a'), 0);
  const std::string other_long = PMSPackageAccountName(std::string(63, 'a') + "b", 0);
  for (const std::string& name : {upper, plus, longest, other_long}) {
    EXPECT_LE(name.size(), 32u) << name;
    EXPECT_EQ(0u, name.rfind("pkg-", 0)) << name;
    EXPECT_EQ(std::string::npos, name.find_first_not_of("abcdefghijklmnopqrstuvwxyz0123456789_.-"))
        << name;
  }
  EXPECT_NE("pkg-demo", upper);
  EXPECT_NE(longest, other_long);
  EXPECT_NE(PMSPackageAccountName("demo", 1), PMSPackageAccountName("demo", 2));
}

TEST_F(ConfinementTest, HostilePackageReachesNothingButItsOwnFolders) {
  // Secrets and settings open to everyone by their modes: only the
  // confinement keeps the package out.
  root_.Write("/run/kivo/sessions/secret-session", "session-secret\n");
  root_.Write("/usr/kivo/etc/packages/gnupg/pubring.kbx", "keyring-secret\n");
  for (const char* path : {"/etc/shadow", "/run/kivo/sessions/secret-session",
                           "/usr/kivo/etc/packages/gnupg/pubring.kbx"}) {
    ASSERT_EQ(0, chmod(root_.Path(path).c_str(), 0644)) << path;
  }
  for (const char* path : {"/run/kivo/sessions", "/usr/kivo/etc/packages/gnupg"}) {
    ASSERT_EQ(0, chmod(root_.Path(path).c_str(), 0755)) << path;
  }
  ASSERT_EQ(0, chmod(root_.Path("/etc/kivoinfo.conf").c_str(), 0666));
  ASSERT_EQ(0, chmod(root_.Path("/var/packages").c_str(), 0777));
  const std::string settings = FileText(root_.Path("/etc/kivoinfo.conf"));

  TestPackage victim;
  victim.id = "victim";
  victim.scripts = {{"postinst", "echo victim-secret > \"$KIVO_PKG_VAR/secret.txt\"\n"}};
  ASSERT_EQ(0, Kivoctl({"install", Build(victim), "--run"}, &out_)) << out_;
  const std::string victim_data = root_.Path("/volume1/@appdata/victim");
  ASSERT_EQ(0, chmod(victim_data.c_str(), 0777));
  ASSERT_EQ(0, chmod((victim_data + "/secret.txt").c_str(), 0644));
  const std::string victim_pid = FileText(victim_data + "/daemon.pid");
  ASSERT_FALSE(victim_pid.empty());

  TestPackage intruder;
  intruder.id = "intruder";
  intruder.daemon = false;
  intruder.info = {{"pidfile", "daemon.pid"}};
  intruder.files = {{"bin/attempt.sh", kAttemptScript}, {"bin/service.sh", kServiceScript}};
  intruder.scripts = {{"postinst",
                       "echo \"$KIVO_WIZARD_victim_pid\" > \"$KIVO_PKG_VAR/victim.pid\"\n"
                       ". \"$KIVO_PKG_DEST/bin/attempt.sh\"\n"
                       "R=\"$KIVO_PKG_VAR/script-report\"\n"
                       "try_everything\n"
                       "echo 'intruder installed' >> \"$KIVO_WORKER_MSG\"\n"},
                      {"start-stop-status", kStartStop}};
  Json::Value wizard;
  wizard["victim_pid"] = victim_pid.substr(0, victim_pid.find('\n'));
  ASSERT_EQ(
      0, Kivoctl({"install", Build(intruder), "--run", "--wizard", KIVOWriteJson(wizard)}, &out_))
      << out_;
  EXPECT_NE(std::string::npos, out_.find("intruder installed")) << out_;
  // Each attempt that failed is in the operation log.
  EXPECT_NE(std::string::npos, out_.find("intruder: shadow was denied")) << out_;
  EXPECT_NE(std::string::npos, out_.find("confinement of intruder: runs as pkg-intruder")) << out_;

  const std::string data = root_.Path("/volume1/@appdata/intruder");
  const std::string script_report = WaitForReport(data + "/script-report");
  const std::string service_report = WaitForReport(data + "/service-report");
  const std::vector<std::string> expected_denied = {
      "shadow",          "sessions",      "keyring", "registry",    "other-data",
      "other-data-read", "settings",      "payload", "link-shadow", "link-sessions",
      "link-other-data", "link-registry", "signal"};
  for (const std::string* report : {&script_report, &service_report}) {
    EXPECT_EQ(std::vector<std::string>(), LinesEndingIn(*report, "ALLOWED")) << *report;
    std::vector<std::string> denied = LinesEndingIn(*report, "denied");
    for (const std::string& name : expected_denied) {
      EXPECT_NE(denied.end(), std::find(denied.begin(), denied.end(), name)) << name << " in\n"
                                                                             << *report;
    }
    // The package still works with what is its own.
    for (const char* ok : {"own-data ok\n", "tmp ok\n", "payload-read ok\n", "done\n"}) {
      EXPECT_NE(std::string::npos, report->find(ok)) << ok << " in\n" << *report;
    }
  }

  // Nothing outside changed; the victim still runs.
  EXPECT_EQ(settings, FileText(root_.Path("/etc/kivoinfo.conf")));
  EXPECT_FALSE(KLIBCFileExist(root_.Path("/var/packages/planted").c_str()));
  EXPECT_FALSE(KLIBCFileExist((victim_data + "/planted").c_str()));
  std::string status;
  Kivoctl({"status", "victim"}, &status);
  EXPECT_EQ("victim 1.0 running\n", status);
  Kivoctl({"status", "intruder"}, &status);
  EXPECT_EQ("intruder 1.0 running\n", status);
  EXPECT_EQ(0, Kivoctl({"stop", "intruder"}, &out_)) << out_;
}

TEST_F(ConfinementTest, AccountOwnsTheDataAndLivesAsLongAsThePackage) {
  TestPackage app;
  app.id = "app";
  app.files = {{"bin/tool", "#!/bin/sh\necho tool\n"}};
  app.scripts = {{"postinst", "id -u > \"$KIVO_PKG_VAR/uid\"\n"}};
  ASSERT_EQ(0, Kivoctl({"install", Build(app)}, &out_)) << out_;
  const std::string line = AccountLine("app");
  ASSERT_EQ(0u, line.rfind("pkg-app:x:", 0)) << FileText(root_.Path("/etc/passwd"));
  const Json::Value record = Confinement("app");
  const unsigned uid = record["uid"].asUInt();
  EXPECT_EQ("pkg-app", record["user"].asString());
  EXPECT_FALSE(record["root"].asBool());
  EXPECT_GE(uid, 30000u);
  EXPECT_LE(uid, 39999u);
  EXPECT_NE(std::string::npos,
            line.find(":" + std::to_string(uid) + ":" + std::to_string(uid) + ":"));
  EXPECT_NE(std::string::npos,
            FileText(root_.Path("/etc/group")).find("pkg-app:x:" + std::to_string(uid) + ":"));
  std::set<std::string> applied;
  for (const Json::Value& a : record["applied"]) applied.insert(a.asString());
  for (const char* what : {"user", "no_new_privs", "landlock_filesystem"}) {
    EXPECT_TRUE(applied.count(what)) << what << ": " << KIVOWriteJson(record);
  }
  EXPECT_EQ(std::to_string(uid) + "\n", FileText(root_.Path("/volume1/@appdata/app/uid")));
  struct stat st;
  ASSERT_EQ(0, stat(root_.Path("/volume1/@appdata/app").c_str(), &st));
  EXPECT_EQ(uid, st.st_uid);
  ASSERT_EQ(0, stat(root_.Path("/var/packages/app/target/bin/tool").c_str(), &st));
  EXPECT_EQ(0u, st.st_uid);

  // An upgrade keeps the account.
  TestPackage v2 = app;
  v2.version = "2.0";
  ASSERT_EQ(0, Kivoctl({"install", Build(v2)}, &out_)) << out_;
  EXPECT_EQ(line, AccountLine("app"));
  EXPECT_EQ(uid, Confinement("app")["uid"].asUInt());

  // Uninstall removes it and its group.
  ASSERT_EQ(0, Kivoctl({"uninstall", "app"}, &out_)) << out_;
  EXPECT_EQ("", AccountLine("app"));
  EXPECT_EQ(std::string::npos, FileText(root_.Path("/etc/group")).find("pkg-app:"));
  EXPECT_FALSE(KLIBCFileExist(root_.Path("/tmp/kivo-package/app").c_str()));
}

TEST_F(ConfinementTest, StartWalksTheDataFolderOnlyUntilAFullPassIsRecorded) {
  TestPackage app;
  app.id = "walked";
  ASSERT_EQ(0, Kivoctl({"install", Build(app)}, &out_)) << out_;
  const unsigned uid = Confinement("walked")["uid"].asUInt();
  const std::string marker = root_.Path("/var/packages/walked/data_owner");
  EXPECT_EQ(std::to_string(uid) + ":" + std::to_string(uid) + "\n", FileText(marker));
  // Root leaves a file deep in the data folder, and the folder itself.
  const std::string data = root_.Path("/volume1/@appdata/walked");
  ASSERT_EQ(0, mkdir((data + "/deep").c_str(), 0755));
  root_.Write("/volume1/@appdata/walked/deep/by-root", "x");
  ASSERT_EQ(0, chown(data.c_str(), 0, 0));
  auto owner = [](const std::string& path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0 ? st.st_uid : 12345u;
  };
  ASSERT_EQ(0, Kivoctl({"start", "walked"}, &out_)) << out_;
  ASSERT_EQ(0, Kivoctl({"stop", "walked"}, &out_)) << out_;
  // A start after a recorded full pass gives back the folder alone...
  EXPECT_EQ(uid, owner(data));
  EXPECT_EQ(0u, owner(data + "/deep/by-root"));
  // ...kivoctl confine makes the full pass...
  ASSERT_EQ(0, Kivoctl({"confine", "walked"}, &out_)) << out_;
  EXPECT_EQ(uid, owner(data + "/deep/by-root"));
  EXPECT_EQ(uid, owner(data + "/deep"));
  // ...and so does a start whose record names another owner.
  root_.Write("/var/packages/walked/data_owner", "1:1\n");
  ASSERT_EQ(0, chown((data + "/deep/by-root").c_str(), 0, 0));
  ASSERT_EQ(0, Kivoctl({"start", "walked"}, &out_)) << out_;
  ASSERT_EQ(0, Kivoctl({"stop", "walked"}, &out_)) << out_;
  EXPECT_EQ(uid, owner(data + "/deep/by-root"));
  EXPECT_EQ(std::to_string(uid) + ":" + std::to_string(uid) + "\n", FileText(marker));

  // Scripts that ran as root may have left root's files: the record no
  // longer vouches for the folder, and the next confined start walks it.
  root_.Write("/etc/kivo/pkgtool.conf", "package_confinement=\"off\"\n");
  ASSERT_EQ(0, Kivoctl({"start", "walked"}, &out_)) << out_;
  ASSERT_EQ(0, chown((data + "/deep/by-root").c_str(), 0, 0));  // as such a script would
  ASSERT_EQ(0, Kivoctl({"stop", "walked"}, &out_)) << out_;
  EXPECT_FALSE(KLIBCFileExist(marker.c_str()));
  root_.Write("/etc/kivo/pkgtool.conf", "");
  ASSERT_EQ(0, Kivoctl({"start", "walked"}, &out_)) << out_;
  ASSERT_EQ(0, Kivoctl({"stop", "walked"}, &out_)) << out_;
  EXPECT_EQ(uid, owner(data + "/deep/by-root"));
}

TEST_F(ConfinementTest, NameTakenByAnotherAccountGetsAnotherName) {
  root_.AddAccount("pkg-demo", "secret-password", {"users"});
  TestPackage demo;
  demo.id = "demo";
  demo.daemon = false;
  ASSERT_EQ(0, Kivoctl({"install", Build(demo)}, &out_)) << out_;
  const std::string line = AccountLine("demo");
  EXPECT_EQ(PMSPackageAccountName("demo", 1) + ":x:", line.substr(0, line.find(':') + 3)) << line;
}

TEST_F(ConfinementTest, PackageInstalledBeforeAccountsGetsOneAtStartOrConfine) {
  TestPackage old;
  old.id = "old";
  ASSERT_EQ(0, Kivoctl({"install", Build(old)}, &out_)) << out_;
  // As a package installed before this change: no account, data root's.
  ForgetAccount("old");
  const std::string data = root_.Path("/volume1/@appdata/old");
  ASSERT_EQ(0, chown(data.c_str(), 0, 0));
  ASSERT_EQ("", AccountLine("old"));

  // Its scripts run, and its record says honestly that it has no account yet.
  ASSERT_EQ(0, Kivoctl({"stop", "old"}, &out_)) << out_;
  const Json::Value before = Confinement("old");
  EXPECT_TRUE(before["root"].asBool()) << KIVOWriteJson(before);
  EXPECT_EQ("user", before["missing"][0]["what"].asString()) << KIVOWriteJson(before);
  EXPECT_NE(std::string::npos, out_.find("not applied: user (the package has no account yet"))
      << out_;
  ASSERT_EQ(0, Kivoctl({"start", "old"}, &out_)) << out_;
  EXPECT_NE("", AccountLine("old"));
  EXPECT_EQ("pkg-old", Confinement("old")["user"].asString());
  struct stat st;
  ASSERT_EQ(0, stat(data.c_str(), &st));
  EXPECT_EQ(Confinement("old")["uid"].asUInt(), st.st_uid);
  std::string pid = FileText(data + "/daemon.pid");
  ASSERT_EQ(0, stat(("/proc/" + pid.substr(0, pid.find('\n'))).c_str(), &st)) << pid;
  EXPECT_EQ(Confinement("old")["uid"].asUInt(), st.st_uid);

  // kivoctl confine does the same for a package that is not started.
  TestPackage quiet;
  quiet.id = "quiet";
  quiet.daemon = false;
  ASSERT_EQ(0, Kivoctl({"install", Build(quiet)}, &out_)) << out_;
  ForgetAccount("quiet");
  ASSERT_EQ(0, Kivoctl({"confine", "quiet"}, &out_)) << out_;
  EXPECT_NE("", AccountLine("quiet"));
  EXPECT_NE(std::string::npos, out_.find("\"user\" : \"pkg-quiet\"")) << out_;
  EXPECT_EQ(1, Kivoctl({"confine", "missing"}, &out_));
  EXPECT_NE(std::string::npos, out_.find("[255]")) << out_;
}

TEST_F(ConfinementTest, PackageDeclaringRootRunsAsRootAndSaysSo) {
  TestPackage admin;
  admin.id = "admin-tool";
  admin.daemon = false;
  admin.info = {{"run_as_root", "yes"}};
  admin.scripts = {{"postinst", "id -u > \"$KIVO_PKG_VAR/uid\"\n"}};
  // Root is granted only to a package signed by a key of the appliance keyring.
  TestKeys keys(root_.Path("/keys"));
  const std::string key = keys.Create("Appliance Publisher <publisher@test.invalid>");
  keys.Trust(key);
  const std::string file = Build(admin);
  keys.Sign(file, key);
  ASSERT_EQ(0, Kivoctl({"install", file}, &out_)) << out_;
  EXPECT_EQ("0\n", FileText(root_.Path("/volume1/@appdata/admin-tool/uid")));
  const Json::Value record = Confinement("admin-tool");
  EXPECT_TRUE(record["root"].asBool());
  EXPECT_EQ(0u, record["applied"].size());
  EXPECT_EQ("the package declares run_as_root", record["missing"][0]["reason"].asString());
  EXPECT_NE(std::string::npos, out_.find("not applied: user (the package declares run_as_root)"))
      << out_;
}

TEST_F(ConfinementTest, ServiceBindingAnotherPackagesPortFailsAndTheOtherKeepsIt) {
  if (access("/usr/bin/python3", X_OK) != 0) GTEST_SKIP() << "skipped: needs /usr/bin/python3";
  TestPackage holder;
  holder.id = "holder";
  holder.daemon = false;
  holder.info = {{"pidfile", "daemon.pid"}, {"displayname", "holder"}};
  holder.files = {{"bin/serve.py", kServePy}};
  holder.scripts = {{"start-stop-status", kServeStartStop}};
  ASSERT_EQ(0, Kivoctl({"install", Build(holder), "--run"}, &out_)) << out_;
  const std::string port = FileText(root_.Path("/volume1/@appdata/holder/port"));
  ASSERT_FALSE(port.empty()) << out_;
  ASSERT_EQ("holder", FirstLineAt(std::stoi(port)));

  // The squatter is given the holder's port and tries to take it.
  TestPackage squatter = holder;
  squatter.id = "squatter";
  squatter.info["displayname"] = "squatter";
  squatter.scripts["postinst"] = "echo \"$KIVO_WIZARD_port\" > \"$KIVO_PKG_VAR/wanted-port\"\n";
  Json::Value wizard;
  wizard["port"] = port;
  ASSERT_EQ(0, Kivoctl({"install", Build(squatter), "--wizard", KIVOWriteJson(wizard)}, &out_))
      << out_;
  EXPECT_NE(0, Kivoctl({"start", "squatter"}, &out_)) << out_;
  const std::string refusal =
      "squatter: cannot bind 127.0.0.1:" + port + ": Address already in use (EADDRINUSE)";
  EXPECT_NE(std::string::npos, out_.find(refusal)) << out_;
  EXPECT_NE(std::string::npos,
            FileText(root_.Path("/volume1/@appdata/squatter/service.log")).find(refusal));
  // It ran confined, as its own user, and still could not take the port.
  EXPECT_EQ("pkg-squatter", Confinement("squatter")["user"].asString());

  // The appliance keeps answering, and the holder keeps its port.
  CgiAnswer list = client().Call("KIVO.Core.Package.Usage", "list", 1);
  ASSERT_TRUE(list.Success()) << list.body;
  EXPECT_EQ(2u, list.Data()["total"].asUInt()) << list.body;
  std::string status;
  Kivoctl({"status", "holder"}, &status);
  EXPECT_EQ("holder 1.0 running\n", status);
  Kivoctl({"status", "squatter"}, &status);
  EXPECT_EQ("squatter 1.0 stopped\n", status);
  EXPECT_EQ("holder", FirstLineAt(std::stoi(port)));
  EXPECT_EQ(0, Kivoctl({"stop", "holder"}, &out_)) << out_;
}

TEST_F(ConfinementTest, ControlGroupsThatWereNotMadeAreInTheRecordAndTheUsage) {
  // The administrator's switch: no package gets control groups.
  root_.Write("/etc/kivo/pkgtool.conf", "package_cgroups=\"no\"\n");
  TestPackage app;
  app.id = "ungrouped";
  ASSERT_EQ(0, Kivoctl({"install", Build(app), "--run"}, &out_)) << out_;
  const Json::Value record = Confinement("ungrouped");
  std::set<std::string> missing;
  for (const Json::Value& m : record["missing"]) {
    if (m["what"].asString().rfind("cgroup", 0) != 0) continue;
    missing.insert(m["what"].asString());
    EXPECT_EQ("turned off (package_cgroups in pkgtool.conf)", m["reason"].asString());
  }
  EXPECT_EQ((std::set<std::string>{"cgroup_cpu", "cgroup_memory", "cgroup_pids"}), missing)
      << KIVOWriteJson(record);
  EXPECT_EQ("partly", record["state"].asString()) << KIVOWriteJson(record);
  EXPECT_EQ("pkg-ungrouped", record["user"].asString());
  // The log says it once per run, with the rest of the confinement.
  EXPECT_NE(std::string::npos,
            out_.find("cgroup_memory (turned off (package_cgroups in pkgtool.conf))"))
      << out_;

  // The web API carries the record as it is.
  CgiAnswer got = client().Call("KIVO.Core.Package.Usage", "get", 1, {{"id", "ungrouped"}});
  ASSERT_TRUE(got.Success()) << got.body;
  EXPECT_EQ(record, got.Data()["confinement"]) << got.body;

  // With the groups back, the next start makes them and the record says so.
  root_.Write("/etc/kivo/pkgtool.conf", "");
  ASSERT_EQ(0, Kivoctl({"stop", "ungrouped"}, &out_)) << out_;
  ASSERT_EQ(0, Kivoctl({"start", "ungrouped"}, &out_)) << out_;
  for (const Json::Value& m : Confinement("ungrouped")["missing"]) {
    EXPECT_NE("turned off (package_cgroups in pkgtool.conf)", m["reason"].asString());
  }
}

TEST_F(ConfinementTest, UsageOfAPackageWithoutARecordSaysNull) {
  TestPackage old;
  old.id = "unrecorded";
  old.daemon = false;
  ASSERT_EQ(0, Kivoctl({"install", Build(old)}, &out_)) << out_;
  ForgetAccount("unrecorded");
  CgiAnswer got = client().Call("KIVO.Core.Package.Usage", "get", 1, {{"id", "unrecorded"}});
  ASSERT_TRUE(got.Success()) << got.body;
  EXPECT_TRUE(got.Data().isMember("confinement")) << got.body;
  EXPECT_TRUE(got.Data()["confinement"].isNull()) << got.body;
}

}  // namespace
