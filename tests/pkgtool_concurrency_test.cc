// Two package operations started at the same moment, through kivoctl and
// through the host: every pair of install, upgrade, uninstall, start and
// stop, on one package and on two. Package scripts sleep while a marker file
// exists, so each operation holds the tool's lock long enough for the other
// to read the registry, wait for the lock and act on what it finds then.
// After each pair the registry must hold every package whole, in a state
// that one of the two orders of the operations explains; the loser of a
// conflict answers busy.

#include <algorithm>
#include <cstring>
#include <dirent.h>
#include <memory>
#include <set>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "klibc/process.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"
#include "testing/cgi_client.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

enum class Op { kInstall, kUpgrade, kUninstall, kStart, kStop, kRollback };
constexpr char kInst[] = "KIVO.Core.Package.Installation";

const Op kOps[] = {Op::kInstall, Op::kUpgrade, Op::kUninstall, Op::kStart, Op::kStop};

const char* Name(Op op) {
  switch (op) {
    case Op::kInstall:
      return "install";
    case Op::kUpgrade:
      return "upgrade";
    case Op::kUninstall:
      return "uninstall";
    case Op::kStart:
      return "start";
    case Op::kStop:
      return "stop";
    case Op::kRollback:
      return "rollback";
  }
  return "?";
}

// What a package is: absent, or a version that runs or not, and the
// earlier version an upgrade kept (compared only where a test follows it).
struct State {
  std::string version;  // "" when not installed
  bool running = false;
  std::string kept;  // "" when none is kept
  bool operator==(const State& o) const {
    return version == o.version && (version.empty() || running == o.running);
  }
};

std::string Describe(const State& s) {
  return s.version.empty() ? "absent" : s.version + (s.running ? " running" : " stopped");
}

// The result an operation must give on `s`, and the state it leaves.
int Apply(Op op, State* s) {
  switch (op) {
    case Op::kInstall:
    case Op::kUpgrade:
      // A fresh install does not start the package; a reinstall or upgrade
      // runs it again when it ran, and keeps the version it replaced.
      s->running = !s->version.empty() && s->running;
      s->kept = s->version;
      s->version = op == Op::kInstall ? "1.0" : "2.0";
      return PKG_OK;
    case Op::kUninstall:
      if (s->version.empty()) return PKG_ERR_NOT_INSTALLED;
      *s = State();
      return PKG_OK;
    case Op::kRollback:
      // Back to the kept version, which runs when the package ran; the
      // version left is kept in turn.
      if (s->version.empty()) return PKG_ERR_NOT_INSTALLED;
      if (s->kept.empty()) return PKG_ERR_NO_REVISION;
      std::swap(s->version, s->kept);
      return PKG_OK;
    case Op::kStart:
    case Op::kStop:
      if (s->version.empty()) return PKG_ERR_NOT_INSTALLED;
      s->running = op == Op::kStart;
      return PKG_OK;
  }
  return -1;
}

// True when running `first` then `second` on `before` gives the results
// seen and ends in `after` (with the same kept version when `with_kept`). A
// busy answer changes nothing.
bool Explains(const State& before, Op first, int first_result, Op second, int second_result,
              const State& after, bool with_kept = false) {
  State s = before;
  for (auto step : {std::make_pair(first, first_result), std::make_pair(second, second_result)}) {
    if (step.second == PKG_ERR_BUSY) continue;
    if (Apply(step.first, &s) != step.second) return false;
  }
  return s == after && (!with_kept || s.kept == after.kept);
}

// A daemon tracked by its pid file whose scripts take a while when the
// marker "<root>/tmp/slow" exists.
TestPackage SlowPackage(const std::string& id, const std::string& version) {
  const std::string pause = "if [ -f \"$KIVO_ROOT/tmp/slow\" ]; then sleep 0.1; fi\n";
  TestPackage p;
  p.id = id;
  p.version = version;
  p.daemon = false;
  p.info = {{"pidfile", "daemon.pid"}};
  p.files = {{"version.txt", version + "\n"}};
  p.scripts = {
      {"preinst", pause},
      {"preupgrade", pause},
      {"preuninst", pause},
      {"start-stop-status",
       "PIDFILE=\"$KIVO_PKG_VAR/daemon.pid\"\n"
       "running() { [ -f \"$PIDFILE\" ] && kill -0 \"$(cat \"$PIDFILE\")\" 2>/dev/null; }\n"
       "case \"$1\" in\n"
       "  start) " +
           pause +
           "    running && exit 0\n"
           "    sh -c 'trap \"exit 0\" TERM; while :; do sleep 0.2; done' >/dev/null 2>&1 "
           "</dev/null &\n"
           "    echo $! >\"$PIDFILE\" ;;\n"
           "  stop) " +
           pause +
           "    running && kill \"$(cat \"$PIDFILE\")\"; rm -f \"$PIDFILE\" ;;\n"
           "  status) running ;;\n"
           "esac\n"}};
  return p;
}

std::set<std::string> ListDir(const std::string& dir) {
  std::set<std::string> names;
  if (DIR* d = opendir(dir.c_str())) {
    while (struct dirent* e = readdir(d)) {
      if (e->d_name[0] != '.' || (strcmp(e->d_name, ".") && strcmp(e->d_name, "..")))
        names.insert(e->d_name);
    }
    closedir(d);
  }
  return names;
}

std::string Link(const std::string& path) {
  char buf[4096];
  ssize_t n = readlink(path.c_str(), buf, sizeof(buf) - 1);
  return n > 0 ? std::string(buf, static_cast<size_t>(n)) : "";
}

// The result code in kivoctl's last line ("... [275]"), 0 on success.
int ToolResult(int exit_status, const std::string& out) {
  if (exit_status == 0) return PKG_OK;
  size_t open = out.rfind('[');
  return open == std::string::npos ? -exit_status : std::atoi(out.c_str() + open + 1);
}

// Runs `a` on `a_id` and `b` on `b_id` at the same moment (both wait on one
// pipe that closes) through `run(index, op, id)`, which returns the tool's
// result code; index 0 is `a`, 1 is `b`.
template <typename Runner>
std::pair<int, int> RunTogether(Runner run, Op a, const std::string& a_id, Op b,
                                const std::string& b_id) {
  int gate[2];
  if (pipe(gate) != 0) abort();
  std::vector<std::pair<pid_t, int>> children;
  const std::pair<Op, std::string> jobs[] = {{a, a_id}, {b, b_id}};
  for (int index = 0; index < 2; ++index) {
    const auto& job = jobs[index];
    int result[2];
    if (pipe(result) != 0) abort();
    pid_t pid = fork();
    if (pid == 0) {
      close(gate[1]);
      char c;
      while (read(gate[0], &c, 1) > 0) {
      }
      int code = run(index, job.first, job.second);
      ssize_t ignored = write(result[1], &code, sizeof(code));
      static_cast<void>(ignored);
      _exit(0);
    }
    close(result[1]);
    children.push_back({pid, result[0]});
  }
  close(gate[0]);
  close(gate[1]);  // both start now
  std::vector<int> codes;
  for (auto child : children) {
    int code = -1000;
    if (read(child.second, &code, sizeof(code)) != sizeof(code)) code = -1000;
    close(child.second);
    waitpid(child.first, nullptr, 0);
    codes.push_back(code);
  }
  return {codes[0], codes[1]};
}

class ConcurrencyTest : public ::testing::Test {
 protected:
  static constexpr const char* kFirst = "alpha";
  static constexpr const char* kSecond = "beta";
  static constexpr const char* kBystander = "gamma";

  void SetUp() override {
    root_.AddAccount("admin", "secret", {"administrators"});
    root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"1\"\n");
    dir_ = root_.Path("/tmp/packages");
    for (const char* id : {kFirst, kSecond, kBystander}) {
      for (const char* version : {"1.0", "2.0"})
        files_[id][version] = SlowPackage(id, version).Build(dir_);
    }
    Reach(kBystander, State{"1.0", true, ""});
    bystander_record_ = Link(root_.Path("/var/packages/") + kBystander);
  }
  void TearDown() override {
    Slow(false);
    for (const std::string& id : PackageRegistry::List()) Kivoctl({"stop", id});
  }

  void Slow(bool on) {
    if (on) {
      root_.Write("/tmp/slow", "");
    } else {
      unlink(root_.Path("/tmp/slow").c_str());
    }
  }
  void LockWait(int seconds) {
    root_.Write("/etc/kivo/pkgtool.conf", "lock_wait=\"" + std::to_string(seconds) + "\"\n");
  }

  // The state of `id` as the registry and its pid file show it.
  State Now(const std::string& id) {
    State s;
    KeyValueMap info;
    if (!PackageRegistry::ReadInfo(id, &info)) return s;
    s.version = info["version"];
    std::string pid;
    s.running = KIVOReadFile(root_.Path("/var/packages/" + id + "/var/daemon.pid"), &pid) &&
                KLIBCProcAlive(static_cast<pid_t>(std::atol(pid.c_str()))) == 1;
    return s;
  }

  // The version of `id` an upgrade kept, as kivoctl revisions names it; ""
  // when none is.
  std::string Kept(const std::string& id) {
    std::string out;
    if (Kivoctl({"revisions", id}, &out) != 0) return "";
    const std::string head = id + " ";
    if (out.compare(0, head.size(), head) != 0) return "";
    return out.substr(head.size(), out.find(' ', head.size()) - head.size());
  }

  // Brings `id` to `want` with quick scripts, through kivoctl.
  void Reach(const std::string& id, const State& want) {
    State now = Now(id);
    std::string out;
    if (!(now.version == want.version)) {
      if (want.version.empty()) {
        ASSERT_EQ(0, Kivoctl({"uninstall", id}, &out)) << out;
      } else {
        ASSERT_EQ(0, Kivoctl({"install", files_[id][want.version]}, &out)) << out;
      }
      now = Now(id);
    }
    if (!want.version.empty() && now.running != want.running) {
      ASSERT_EQ(0, Kivoctl({want.running ? "start" : "stop", id}, &out)) << out;
    }
    ASSERT_TRUE(Now(id) == want) << id << " is " << Describe(Now(id));
  }

  // The state a package starts from for a pair: absent when one of the
  // operations installs it, else version 1.0, stopped when one starts it.
  static State StartState(const std::vector<Op>& ops_on_it) {
    auto has = [&](Op op) {
      return std::find(ops_on_it.begin(), ops_on_it.end(), op) != ops_on_it.end();
    };
    if (has(Op::kInstall)) return State();
    return State{"1.0", !has(Op::kStart), ""};
  }

  // Every package whole: its published name a link to a complete record of
  // its own, whose payload is the version INFO names and whose data folder
  // exists; no record, payload or half-made name that no package owns;
  // kivoctl list agrees; the bystander untouched.
  void ExpectRegistryWhole(const std::string& context) {
    SCOPED_TRACE(context);
    const std::string reg = root_.Path("/var/packages");
    std::set<std::string> records, payloads, listed;
    for (const std::string& name : ListDir(reg)) {
      ASSERT_NE(0u, name.find(".publish-")) << "half-made name " << name;
      if (name == ".records") continue;
      std::string record = Link(reg + "/" + name);
      ASSERT_TRUE(PackageRegistry::IsRecordNameOf(name, record)) << name << " -> " << record;
      records.insert(record.substr(9));
      KeyValueMap info;
      ASSERT_TRUE(PackageRegistry::ReadInfo(name, &info)) << name << " has no INFO";
      std::string target = Link(reg + "/" + name + "/target");
      std::string text;
      ASSERT_TRUE(KIVOReadFile(target + "/version.txt", &text)) << name << ": no payload";
      EXPECT_EQ(info["version"] + "\n", text) << name;
      payloads.insert(target.substr(target.rfind('/') + 1));
      struct stat st;
      EXPECT_EQ(0, stat((reg + "/" + name + "/var").c_str(), &st)) << name << ": no data folder";
      State s = Now(name);
      listed.insert(name + " " + s.version + (s.running ? " running" : " stopped"));
    }
    // Earlier versions that upgrades kept keep their records and payloads,
    // and their copies of data are all that stays in the copies' folder.
    const std::string copies = root_.Path("/volume1/@appdata/.snapshots");
    for (const std::string& id : ListDir(copies)) {
      for (const std::string& name : ListDir(copies + "/" + id)) {
        const size_t suffix = name.rfind(".kept");
        ASSERT_EQ(name.size() - 5, suffix) << "a copy left: " << id << "/" << name;
        const std::string record = name.substr(0, suffix);
        EXPECT_TRUE(KLIBCFileExist((reg + "/.records/" + record + "/INFO").c_str())) << record;
        records.insert(record);
        const std::string target = Link(reg + "/.records/" + record + "/target");
        payloads.insert(target.substr(target.rfind('/') + 1));
      }
    }
    EXPECT_EQ(records, ListDir(reg + "/.records")) << "orphaned records";
    EXPECT_EQ(payloads, ListDir(root_.Path("/volume1/@appstore"))) << "orphaned payloads";
    std::set<std::string> data;
    for (const std::string& line : listed) data.insert(line.substr(0, line.find(' ')));
    if (!ListDir(copies).empty()) data.insert(".snapshots");
    EXPECT_EQ(data, ListDir(root_.Path("/volume1/@appdata"))) << "data folders";
    std::string out;
    ASSERT_EQ(0, Kivoctl({"list"}, &out)) << out;
    std::set<std::string> lines;
    for (size_t at = 0, nl; (nl = out.find('\n', at)) != std::string::npos; at = nl + 1)
      lines.insert(out.substr(at, nl - at));
    EXPECT_EQ(listed, lines) << "kivoctl list";
    EXPECT_EQ(bystander_record_, Link(reg + "/" + kBystander)) << "the bystander was touched";
    EXPECT_TRUE(Now(kBystander) == (State{"1.0", true, ""})) << Describe(Now(kBystander));
  }

  // Readies operation `index` (0 or 1) of a pair before the pair starts.
  virtual void Prepare(int index, Op op, const std::string& id) {}
  // Runs it; the tool's result code.
  virtual int Run(int index, Op op, const std::string& id) = 0;
  // Every pair of operations once, on one package or on two, each checked
  // against the model and the registry's invariants. How many answers were
  // busy.
  int Matrix(bool same_package);

  TempRoot root_;
  std::string dir_;
  std::map<std::string, std::map<std::string, std::string>> files_;
  std::string bystander_record_;
};

int ConcurrencyTest::Matrix(bool same_package) {
  int busy = 0;
  for (size_t i = 0; i < 5; ++i) {
    for (size_t j = i; j < 5; ++j) {
      Op a = kOps[i], b = kOps[j];
      std::string b_id = same_package ? kFirst : kSecond;
      std::vector<Op> on_first = {a};
      if (same_package) on_first.push_back(b);
      State first_before = StartState(on_first), second_before = StartState({b});
      Slow(false);
      Reach(kFirst, first_before);
      if (!same_package) Reach(kSecond, second_before);
      Prepare(0, a, kFirst);
      Prepare(1, b, b_id);
      Slow(true);
      auto r = RunTogether(
          [this](int index, Op op, const std::string& id) { return Run(index, op, id); }, a, kFirst,
          b, b_id);
      std::string context = std::string(Name(a)) + " " + kFirst + " with " + Name(b) + " " + b_id +
                            ": results " + std::to_string(r.first) + ", " +
                            std::to_string(r.second);
      busy += (r.first == PKG_ERR_BUSY) + (r.second == PKG_ERR_BUSY);
      if (same_package) {
        State after = Now(kFirst);
        EXPECT_TRUE(Explains(first_before, a, r.first, b, r.second, after) ||
                    Explains(first_before, b, r.second, a, r.first, after))
            << context << " left " << Describe(after);
      } else {
        // Operations on two packages share the lock, never each other's state.
        State s1 = first_before, s2 = second_before;
        EXPECT_EQ(r.first == PKG_ERR_BUSY ? PKG_ERR_BUSY : Apply(a, &s1), r.first) << context;
        EXPECT_EQ(r.second == PKG_ERR_BUSY ? PKG_ERR_BUSY : Apply(b, &s2), r.second) << context;
        EXPECT_TRUE(Now(kFirst) == (r.first == PKG_ERR_BUSY ? first_before : s1)) << context;
        EXPECT_TRUE(Now(kSecond) == (r.second == PKG_ERR_BUSY ? second_before : s2)) << context;
      }
      ExpectRegistryWhole(context);
      if (HasFatalFailure()) return busy;
    }
  }
  return busy;
}

class KivoctlConcurrencyTest : public ConcurrencyTest {
 protected:
  int Run(int, Op op, const std::string& id) override {
    std::string out;
    std::vector<std::string> args;
    if (op == Op::kInstall || op == Op::kUpgrade) {
      args = {"install", files_[id][op == Op::kInstall ? "1.0" : "2.0"]};
    } else {  // uninstall, start, stop, rollback
      args = {Name(op), id};
    }
    return ToolResult(Kivoctl(args, &out), out);
  }
};

// The loser waits for the lock, then acts on the registry as the winner left it.
TEST_F(KivoctlConcurrencyTest, PairsOnOnePackage) {
  LockWait(3);
  EXPECT_EQ(0, Matrix(true));
}

TEST_F(KivoctlConcurrencyTest, PairsOnTwoPackages) {
  LockWait(3);
  EXPECT_EQ(0, Matrix(false));
}

// With no wait, the loser of a pair answers busy and changes nothing.
TEST_F(KivoctlConcurrencyTest, PairsWhoseLoserIsBusy) {
  LockWait(0);
  EXPECT_GT(Matrix(true), 0);
}

// A rollback and another operation of the same package at once, from 2.0
// running with 1.0 kept: they run one after the other, each answer and the
// package's version, run state and kept version as one of the two orders
// explains, the registry whole.
TEST_F(KivoctlConcurrencyTest, RollbackBesideEachOperationOnOnePackage) {
  LockWait(3);
  for (Op other : {Op::kUpgrade, Op::kUninstall, Op::kStart, Op::kStop, Op::kRollback}) {
    Slow(false);
    std::string out;
    if (PackageRegistry::IsInstalled(kFirst)) {
      ASSERT_EQ(0, Kivoctl({"uninstall", kFirst}, &out)) << out;
    }
    ASSERT_EQ(0, Kivoctl({"install", files_[kFirst]["1.0"]}, &out)) << out;
    ASSERT_EQ(0, Kivoctl({"start", kFirst}, &out)) << out;
    ASSERT_EQ(0, Kivoctl({"install", files_[kFirst]["2.0"]}, &out)) << out;
    const State before{"2.0", true, "1.0"};
    ASSERT_TRUE(Now(kFirst) == before && Kept(kFirst) == "1.0") << Describe(Now(kFirst));
    Slow(true);
    auto r =
        RunTogether([this](int index, Op op, const std::string& id) { return Run(index, op, id); },
                    Op::kRollback, kFirst, other, kFirst);
    State after = Now(kFirst);
    after.kept = Kept(kFirst);
    const std::string context = std::string("rollback with ") + Name(other) + ": results " +
                                std::to_string(r.first) + ", " + std::to_string(r.second);
    EXPECT_TRUE(Explains(before, Op::kRollback, r.first, other, r.second, after, true) ||
                Explains(before, other, r.second, Op::kRollback, r.first, after, true))
        << context << " left " << Describe(after) << ", kept " << after.kept;
    ExpectRegistryWhole(context);
    if (HasFatalFailure()) return;
  }
}

// Two uninstalls of one package 0.3 s apart, the first held up in a slow
// preuninst: the second finds the package gone once it has the lock, and
// every other package stays registered with its files.
TEST_F(KivoctlConcurrencyTest, SecondUninstallFindsThePackageGone) {
  TestPackage victim = SlowPackage(kFirst, "1.0");
  victim.scripts["preuninst"] = "sleep 1\n";
  std::string out;
  ASSERT_EQ(0, Kivoctl({"install", victim.Build(dir_ + "/victim")}, &out)) << out;
  pid_t first = fork();
  if (first == 0) _exit(Kivoctl({"uninstall", kFirst}));
  usleep(300000);
  int second = Kivoctl({"uninstall", kFirst}, &out);
  int first_status = 0;
  waitpid(first, &first_status, 0);
  EXPECT_EQ(0, WEXITSTATUS(first_status));
  EXPECT_EQ(PKG_ERR_NOT_INSTALLED, ToolResult(second, out)) << out;
  ExpectRegistryWhole("two uninstalls");
  EXPECT_FALSE(PackageRegistry::IsInstalled(kFirst));
}

class HostConcurrencyTest : public ConcurrencyTest {
 protected:
  void SetUp() override {
    ConcurrencyTest::SetUp();
    client_.reset(new ApiClient("admin", "secret"));
    ASSERT_TRUE(client_->signed_in());
    LockWait(3);
  }
  // The tool's result behind a host answer: busy is 4530. A package that is
  // not installed is 4501 for start and stop when the module sees it first,
  // else the tool's 255 under its lock comes back as the generic start or
  // stop failure (4580, 4581); for uninstall it is 4560.
  static int ToolCode(Op op, const CgiAnswer& a) {
    if (a.Success()) return PKG_OK;
    if (a.Code() == 4530) return PKG_ERR_BUSY;
    const int control_failure = op == Op::kStart ? 4580 : 4581;
    if ((op == Op::kStart || op == Op::kStop) &&
        (a.Code() == 4501 || a.Code() == control_failure)) {
      return PKG_ERR_NOT_INSTALLED;
    }
    if (op == Op::kUninstall && a.Code() == 4560) return PKG_ERR_NOT_INSTALLED;
    return 10000 + a.Code();
  }
  // An install or upgrade installs a file uploaded beforehand.
  void Prepare(int index, Op op, const std::string& id) override {
    tasks_[index].clear();
    if (op != Op::kInstall && op != Op::kUpgrade) return;
    CgiAnswer up =
        client_->Upload(kInst, "upload", 1, {}, files_[id][op == Op::kInstall ? "1.0" : "2.0"]);
    EXPECT_TRUE(up.Success()) << up.body;
    tasks_[index] = up.Data()["task_id"].asString();
  }
  int Run(int index, Op op, const std::string& id) override {
    switch (op) {
      case Op::kInstall:
      case Op::kUpgrade:
        return ToolCode(op, client_->Call(kInst, "install", 1, {{"task_id", tasks_[index]}}));
      case Op::kUninstall:
        return ToolCode(
            op, client_->Call("KIVO.Core.Package.Uninstallation", "uninstall", 1, {{"id", id}}));
      case Op::kStart:
      case Op::kStop:
        return ToolCode(op, client_->Call("KIVO.Core.Package.Control", Name(op), 1,
                                          {{"id", "[\"" + id + "\"]"}}));
      case Op::kRollback:
        break;  // not among the pairs the host runs
    }
    return -1;
  }

  std::unique_ptr<ApiClient> client_;
  std::string tasks_[2];
};

// Every pair through the web API: whatever order the host's processes get
// the lock in, the registry stays whole and each answer is one that order
// explains.
TEST_F(HostConcurrencyTest, PairsOnOnePackage) { Matrix(true); }

TEST_F(HostConcurrencyTest, PairsOnTwoPackages) { Matrix(false); }

}  // namespace
