// The package module's answer codes for package-tool results, each produced
// from its real condition through the host: keys, payloads, scripts and
// installed state made by the test, no stubs.

#include <future>
#include <memory>
#include <random>
#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "pkgtool/package_state.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "pkgtool/signature.h"
#include "testing/admin_api_test.h"
#include "testing/cgi_client.h"
#include "testing/gpg_keys.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

#include <netinet/in.h>

namespace {

constexpr char kInst[] = "KIVO.Core.Package.Installation";
constexpr char kControl[] = "KIVO.Core.Package.Control";

// Waits for a file a package script creates; false after ten seconds.
bool AppearsSoon(const std::string& path) {
  for (int i = 0; i < 1000; ++i) {
    if (access(path.c_str(), F_OK) == 0) return true;
    usleep(10000);
  }
  return false;
}

// A listening TCP socket on a port the kernel chose; the port through *port.
int ListenOnSomePort(int* port) {
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_ANY);
  socklen_t len = sizeof(addr);
  if (fd < 0 || bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0 ||
      listen(fd, 1) != 0 || getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
    if (fd >= 0) close(fd);
    return -1;
  }
  *port = ntohs(addr.sin_port);
  return fd;
}

class CodeMappingTest : public AdminApiTest {
 protected:
  void SetUp() override {
    Trust(1);
    dir_ = root_.Path("/tmp/packages");
    ASSERT_EQ(0, KIVOFSMkdirP(dir_.c_str()));
  }
  void TearDown() override { StopInstalledPackages(); }
  CgiAnswer Upload(const std::string& file) {
    return client().Upload(kInst, "upload", 1, {}, file);
  }
  CgiAnswer Install(const std::string& file, const Params& extra = {}) {
    Params params = {{"path", file}};
    params.insert(params.end(), extra.begin(), extra.end());
    return client().Call(kInst, "install", 1, params);
  }

  std::string dir_;
};

// Signature outcomes: lenient at upload ("codesign_error"), the error of a
// strict install. 288 -> 4531, 290 -> 4533 and 289 -> 4532 are in
// install_flow_test; here 291 -> 4534 and 292 -> 4535.
TEST_F(CodeMappingTest, ExpiredAndRevokedKeys) {
  TestKeys keys(root_.Path("/tmp"));
  std::string expired = keys.Create("Old Publisher <old@test.invalid>", true);
  std::string revoked = keys.Create("Lost Key <lost@test.invalid>");
  keys.Trust(expired);
  TestPackage a;
  a.id = "by-expired";
  std::string by_expired = a.Build(dir_);
  keys.Sign(by_expired, expired, true);
  TestPackage b;
  b.id = "by-revoked";
  std::string by_revoked = b.Build(dir_);
  keys.Sign(by_revoked, revoked);
  keys.Revoke(revoked);
  keys.Trust(revoked);
  Trust(0);
  for (const auto& c : {std::make_pair(by_expired, 4534), std::make_pair(by_revoked, 4535)}) {
    CgiAnswer up = Upload(c.first);
    ASSERT_TRUE(up.Success()) << up.body;
    EXPECT_EQ(c.second, up.Data()["codesign_error"].asInt()) << up.body;
    CgiAnswer strict = Install(c.first);
    EXPECT_EQ(c.second, strict.Code()) << strict.body;
    EXPECT_FALSE(strict.Errors()["message"].asString().empty()) << strict.body;
  }
}

// 277 at the check -> 4529, with the tool's message.
TEST_F(CodeMappingTest, HostileMemberAtTheCheck) {
  std::string file = BuildRawPackage(dir_, "hostile", {{"../escape.txt", 'f', 0644, ""}});
  CgiAnswer up = Upload(file);
  EXPECT_EQ(4529, up.Code()) << up.body;
  EXPECT_FALSE(up.Errors()["message"].asString().empty());
  EXPECT_EQ(4529, Install(file).Code());
}

// Install results: 267 -> 4546 with both versions, 274 -> 4549, 275 -> 4530.
TEST_F(CodeMappingTest, InstallRefusals) {
  TestPackage app;
  std::string file = app.Build(dir_);
  ASSERT_TRUE(Install(file).Success());
  CgiAnswer same = Install(file, {{"force", "false"}});
  EXPECT_EQ(4546, same.Code()) << same.body;
  EXPECT_EQ("1.0", same.Errors()["current_version"].asString());
  EXPECT_EQ("1.0", same.Errors()["install_version"].asString());
  EXPECT_TRUE(same.Errors()["worker_message"].isArray());

  TestPackage failing;
  failing.id = "failing";
  failing.scripts = {{"preinst", "echo 'not today' >&2; exit 1\n"}};
  CgiAnswer script = Install(failing.Build(dir_));
  EXPECT_EQ(4549, script.Code()) << script.body;
  EXPECT_FALSE(PackageRegistry::IsInstalled("failing"));

  TestPackage other;
  other.id = "other";
  int lock = PMSLockFile(root_.Path("/run/kivo/pkgtool/lock"), 1);
  CgiAnswer busy = Install(other.Build(dir_));
  PMSUnlockFile(lock);
  EXPECT_EQ(4530, busy.Code()) << busy.body;
}

// Refusals of the package file's check, at upload and again at install:
// 261 -> 4522 (the payload cut short after a sound header), 283 -> 4527,
// 281 -> 4528, 302 -> 4537. A package format newer than the tool (293) is
// found when the file is first read, so it is answered as no readable
// package file, 4521.
TEST_F(CodeMappingTest, CheckRefusals) {
  TestPackage big;
  big.id = "cut-short";
  std::string noise(64 * 1024, '\0');
  std::mt19937 random(7);
  for (char& c : noise) c = static_cast<char>(random());
  big.files = {{"noise.bin", noise}};
  std::string cut = big.Build(dir_);
  std::string whole;
  ASSERT_TRUE(KIVOReadFile(cut, &whole, 1 << 20));
  // The payload is the last member: dropping the archive's end and part of
  // the payload leaves every member before it intact.
  ASSERT_TRUE(
      KIVOWriteFileAtomic(cut, whole.substr(0, whole.size() - 1024 - 16 * 1024), SyncToDisk::No));
  CgiAnswer truncated = Upload(cut);
  EXPECT_EQ(4522, truncated.Code()) << truncated.body;
  EXPECT_FALSE(truncated.Errors()["message"].asString().empty()) << truncated.body;
  EXPECT_EQ(4522, Install(cut).Code());

  int port = 0;
  int listener = ListenOnSomePort(&port);
  ASSERT_GE(listener, 0);
  TestPackage server;
  server.id = "port-user";
  server.info = {{"adminport", std::to_string(port)}};
  std::string server_file = server.Build(dir_);
  CgiAnswer taken = Upload(server_file);
  EXPECT_EQ(4527, taken.Code()) << taken.body;
  EXPECT_EQ(port, taken.Errors()["port"].asInt()) << taken.body;
  EXPECT_EQ(4527, Install(server_file).Code());
  close(listener);
  EXPECT_TRUE(Install(server_file).Success());  // the port is free again

  TestPackage foreign;
  foreign.id = "foreign";
  foreign.info = {{"arch", "no-such-arch"}};
  std::string foreign_file = foreign.Build(dir_);
  CgiAnswer arch = Upload(foreign_file);
  EXPECT_EQ(4528, arch.Code()) << arch.body;
  EXPECT_NE(std::string::npos, arch.Errors()["message"].asString().find("no-such-arch"));
  EXPECT_EQ(4528, Install(foreign_file).Code());
  EXPECT_FALSE(PackageRegistry::IsInstalled("foreign"));

  TestPackage old;
  old.id = "old-os";
  old.info = {{"os_max_ver", "0.1-0001"}};
  CgiAnswer too_new = Upload(old.Build(dir_));
  EXPECT_EQ(4537, too_new.Code()) << too_new.body;
  EXPECT_EQ("0.1-0001", too_new.Errors()["firmware"].asString()) << too_new.body;

  std::string future = dir_ + "/future.kpk";
  MemberList members = {{"INFO",
                         "package=\"future\"\nversion=\"1.0\"\nstartable=\"no\"\n"
                         "extractsize=\"8\"\n"}};
  std::string payload = dir_ + "/future-payload.tgz";
  WriteRawPayload(payload, {{"file.txt", 'f', 0644, ""}});
  std::string payload_bytes;
  ASSERT_TRUE(KIVOReadFile(payload, &payload_bytes, 1 << 20));
  members.push_back({"package.tgz", payload_bytes});
  std::string manifest = Manifest(members);
  ASSERT_EQ(0u, manifest.find("KIVO-MANIFEST 1\n")) << manifest;
  manifest.replace(0, 15, "KIVO-MANIFEST 2");
  members.insert(members.begin(), {"MANIFEST", manifest});
  WriteRawPackageFile(future, members);
  CgiAnswer format = Upload(future);
  EXPECT_EQ(4521, format.Code()) << format.body;
  EXPECT_FALSE(format.Errors()["message"].asString().empty()) << format.body;
  EXPECT_EQ(4521, Install(future).Code());
}

// GnuPG cannot be used (150): the keyring folder is a file. The upload
// warns with 4501 and the tool's words; a strict install refuses with 4501.
TEST_F(CodeMappingTest, SignatureUncheckable) {
  TestKeys keys(root_.Path("/tmp"));
  std::string fpr = keys.Create("Some Publisher <some@test.invalid>");
  TestPackage app;
  app.id = "signed";
  std::string file = app.Build(dir_);
  keys.Sign(file, fpr);
  std::string out;
  ASSERT_EQ(0, RunProgram({"rm", "-rf", PMSKeyringHome()}, &out)) << out;
  root_.Write(PMSKeyringHome().substr(root_.dir().size()), "not a keyring folder\n");
  CgiAnswer up = Upload(file);
  ASSERT_TRUE(up.Success()) << up.body;
  EXPECT_EQ(4501, up.Data()["codesign_error"].asInt()) << up.body;
  EXPECT_FALSE(up.Data()["codesign_message"].asString().empty()) << up.body;
  CgiAnswer strict = Install(file);
  EXPECT_EQ(4501, strict.Code()) << strict.body;
  EXPECT_FALSE(strict.Errors()["message"].asString().empty()) << strict.body;
  EXPECT_FALSE(PackageRegistry::IsInstalled("signed"));
}

// Failures of the install itself, after a check that passed: 270 -> 4544,
// 276 -> 4540 (a payload file where a later entry needs a folder, which
// only writing it finds), 305 -> 4542 (the old version stays).
TEST_F(CodeMappingTest, InstallFailures) {
  TestPackage app;
  app.id = "wizard-app";
  std::string file = app.Build(dir_);
  CgiAnswer values = Install(file, {{"extra_values", "{not json"}});
  EXPECT_EQ(4544, values.Code()) << values.body;
  EXPECT_FALSE(values.Errors()["message"].asString().empty()) << values.body;
  EXPECT_FALSE(PackageRegistry::IsInstalled("wizard-app"));

  std::string clash =
      BuildRawPackage(dir_, "clash", {{"a", 'f', 0644, ""}, {"a/b", 'f', 0644, ""}});
  ASSERT_TRUE(Upload(clash).Success());
  CgiAnswer extract = Install(clash);
  EXPECT_EQ(4540, extract.Code()) << extract.body;
  EXPECT_NE(std::string::npos, extract.Errors()["message"].asString().find("a/b")) << extract.body;
  EXPECT_FALSE(PackageRegistry::IsInstalled("clash"));

  TestPackage v1;
  v1.id = "upgraded";
  ASSERT_TRUE(Install(v1.Build(dir_)).Success());
  TestPackage v2 = v1;
  v2.version = "2.0";
  v2.scripts = {{"preupgrade", "echo 'cannot migrate' >&2; exit 1\n"}};
  CgiAnswer upgrade = Install(v2.Build(dir_));
  EXPECT_EQ(4542, upgrade.Code()) << upgrade.body;
  EXPECT_TRUE(upgrade.Errors()["worker_message"].isArray()) << upgrade.body;
  PackageInfo installed;
  ASSERT_TRUE(PMSLoadInstalled("upgraded", &installed));
  EXPECT_EQ("1.0", installed.getVersion());
}

// A needed package that was running at the check and is down when the
// install looks again: 268 at the install -> 4547 (at the check it is
// 4526). Its status script answers "running" once more, then "stopped".
TEST_F(CodeMappingTest, DependencyGoneBeforeInstall) {
  // In flaky's own data folder: its confined scripts reach no other.
  const std::string flag = root_.Path("/volume1/@appdata/flaky/stops-after-next-status");
  const std::string down = root_.Path("/volume1/@appdata/flaky/down");
  TestPackage flaky;
  flaky.id = "flaky";
  flaky.daemon = false;
  flaky.scripts = {{"start-stop-status",
                    "[ \"$1\" = status ] || exit 0\n"
                    "[ -e '" +
                        down +
                        "' ] && exit 1\n"
                        "[ -e '" +
                        flag + "' ] && mv '" + flag + "' '" + down +
                        "'\n"
                        "exit 0\n"}};
  std::string out;
  ASSERT_EQ(0, Kivoctl({"install", flaky.Build(dir_)}, &out)) << out;
  TestPackage user;
  user.id = "needs-flaky";
  user.info = {{"install_dep_packages", "flaky"}};
  std::string file = user.Build(dir_);
  root_.Write(flag.substr(root_.dir().size()), "");
  CgiAnswer install = Install(file);
  EXPECT_EQ(4547, install.Code()) << install.body;
  EXPECT_NE(std::string::npos, install.Errors()["packages"].asString().find("flaky"))
      << install.body;
  EXPECT_FALSE(PackageRegistry::IsInstalled("needs-flaky"));
  // Down from the start, the check itself refuses.
  EXPECT_EQ(4526, Install(file).Code());
}

// A start whose needed package is upgraded past what it accepts while the
// start waits for the tool: the module's own look found 1.0, the tool's
// look under the lock finds 2.0, 259 -> 4583. The upgrade's preupgrade
// holds it until the start has looked.
TEST_F(CodeMappingTest, StartAfterNeededPackageUpgraded) {
  // The gate is lib's own data folder: its confined scripts reach no other.
  const std::string gate = root_.Path("/volume1/@appdata/lib");
  root_.Write("/etc/kivo/pkgtool.conf", "lock_wait=\"30\"\n");
  TestPackage lib;
  lib.id = "lib";
  lib.daemon = false;
  lib.scripts = {
      {"start-stop-status", "[ \"$1\" = status ] && touch '" + gate + "/asked'\nexit 0\n"}};
  std::string out;
  ASSERT_EQ(0, Kivoctl({"install", lib.Build(dir_)}, &out)) << out;
  TestPackage app;
  app.id = "app";
  app.info = {{"install_dep_packages", "lib<2.0"}};
  ASSERT_EQ(0, Kivoctl({"install", app.Build(dir_)}, &out)) << out;

  TestPackage lib2 = lib;
  lib2.version = "2.0";
  lib2.scripts["preupgrade"] = "touch '" + gate +
                               "/in-preupgrade'\n"
                               "while [ ! -e '" +
                               gate + "/go' ]; do sleep 0.05; done\n";
  std::string lib2_file = lib2.Build(dir_);
  const ApiClient& api = client();
  auto upgrade = std::async(std::launch::async, [&] { return Install(lib2_file); });
  ASSERT_TRUE(AppearsSoon(gate + "/in-preupgrade"));
  unlink((gate + "/asked").c_str());
  auto start = std::async(std::launch::async, [&] {
    return api.Call(kControl, "start", 1, {{"id", "app"}});
  });
  bool looked = AppearsSoon(gate + "/asked");
  root_.Write("/volume1/@appdata/lib/go", "");
  ASSERT_TRUE(looked);
  CgiAnswer upgraded = upgrade.get();
  ASSERT_TRUE(upgraded.Success()) << upgraded.body;
  CgiAnswer started = start.get();
  EXPECT_EQ(4583, started.Code()) << started.body;
  EXPECT_EQ(4583, started.Errors()["code"].asInt()) << started.body;
  EXPECT_EQ("2.0", started.Errors()["current_version"].asString()) << started.body;
  EXPECT_EQ("lib<2.0", started.Errors()["require_version"].asString()) << started.body;
}

}  // namespace
