// The package module's answer codes for package-tool results, each produced
// from its real condition through the host: keys, payloads, scripts and
// installed state made by the test, no stubs.

#include <memory>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "testing/cgi_client.h"
#include "testing/gpg_keys.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

constexpr char kInst[] = "KIVO.Core.Package.Installation";

class CodeMappingTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_.AddAccount("admin", "secret", {"administrators"});
    Trust(1);
    dir_ = root_.Path("/tmp/packages");
    ASSERT_EQ(0, KIVOFSMkdirP(dir_.c_str()));
  }
  void TearDown() override {
    for (const std::string& id : PackageRegistry::List()) Kivoctl({"stop", id});
  }
  void Trust(int level) {
    root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"" + std::to_string(level) + "\"\n");
  }
  const ApiClient& client() {
    if (!client_) client_.reset(new ApiClient("admin", "secret"));
    return *client_;
  }
  CgiAnswer Upload(const std::string& file) {
    return client().Upload(kInst, "upload", 1, {}, file);
  }
  CgiAnswer Install(const std::string& file, const Params& extra = {}) {
    Params params = {{"path", file}};
    params.insert(params.end(), extra.begin(), extra.end());
    return client().Call(kInst, "install", 1, params);
  }

  TempRoot root_;
  std::string dir_;
  std::unique_ptr<ApiClient> client_;
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

}  // namespace
