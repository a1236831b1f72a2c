// "KIVO.Core.Package.Log" "get" through the real host on a temporary root.

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "klibc/process.h"
#include "testing/admin_api_test.h"
#include "testing/cgi_client.h"
#include "testing/temp_root.h"

namespace {

class LogGetTest : public AdminApiTest {
 protected:
  // A registry record as the package tool leaves it.
  void Install(const std::string& id, const std::string& info) {
    root_.Write("/var/packages/" + id + "/INFO", "package=\"" + id + "\"\n" + info);
    ASSERT_EQ(0, KIVOFSMkdirP(root_.Path("/var/packages/" + id + "/var").c_str()));
  }

  CgiAnswer GetLog(const std::string& name) {
    return client().Call("KIVO.Core.Package.Log", "get", 1, {{"name", name}});
  }
};

TEST_F(LogGetTest, PackageWithALog) {
  Install("demo-web", "logfile=\"log/web.log\"\n");
  root_.Write("/var/packages/demo-web/var/log/web.log", "started\nserving on 8080\n");
  CgiAnswer a = GetLog("demo-web");
  ASSERT_TRUE(a.Success()) << a.body;
  EXPECT_EQ("started\nserving on 8080\n", a.Data()["pkglog"].asString());
  EXPECT_EQ(1u, a.Data().size());
}

TEST_F(LogGetTest, NoLogDeclaredNotWrittenYetOrUnknownPackage) {
  Install("quiet", "");
  Install("later", "logfile=\"app.log\"\n");
  for (const char* name : {"quiet", "later", "unknown", "../../etc", "a/b"}) {
    CgiAnswer a = GetLog(name);
    ASSERT_TRUE(a.Success()) << name << ": " << a.body;
    EXPECT_EQ("", a.Data()["pkglog"].asString()) << name;
  }
}

TEST_F(LogGetTest, LogPathsThatLeaveThePackageAreNotRead) {
  root_.Write("/etc/secret", "do not show\n");
  Install("escape", "logfile=\"../../../../etc/secret\"\n");
  Install("linked", "logfile=\"log\"\n");
  ASSERT_EQ(0, symlink(root_.Path("/etc/secret").c_str(),
                       root_.Path("/var/packages/linked/var/log").c_str()));
  EXPECT_EQ("", GetLog("escape").Data()["pkglog"].asString());
  EXPECT_EQ("", GetLog("linked").Data()["pkglog"].asString());
}

TEST_F(LogGetTest, LargeLogGivesItsRecentEnd) {
  Install("chatty", "logfile=\"big.log\"\n");
  std::string text(3 << 20, 'a');
  text += "the end\n";
  root_.Write("/var/packages/chatty/var/big.log", text);
  std::string log = GetLog("chatty").Data()["pkglog"].asString();
  EXPECT_EQ(1u << 20, log.size());
  EXPECT_EQ("the end\n", log.substr(log.size() - 8));
}

TEST_F(LogGetTest, UnreadableRegistryIsAGeneralFailure) {
  ApiClient admin("admin", "secret");
  ASSERT_EQ(0, KLIBCExec("/bin/rm", "-rf", root_.Path("/var/packages").c_str(), nullptr, nullptr));
  root_.Write("/var/packages", "not a folder");
  CgiAnswer a = admin.Call("KIVO.Core.Package.Log", "get", 1, {{"name", "x"}});
  EXPECT_EQ(4501, a.Code()) << a.body;
  EXPECT_FALSE(a.json["error"].isMember("errors"));
}

}  // namespace
