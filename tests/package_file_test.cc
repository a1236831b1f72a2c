// Package files that must be refused, and code signatures by trust level,
// checked by the package tool before anything is installed.

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "pkgtool/package_builder.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/registry.h"
#include "testing/gpg_keys.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

class PackageFileTest : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = root_.Path("/tmp/packages");
    ASSERT_EQ(0, KIVOFSMkdirP(dir_.c_str()));
    SetTrustLevel(1);
  }
  void SetTrustLevel(int level) {
    root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"" + std::to_string(level) + "\"\n");
  }
  // The result of checking `file`; `details` gets the details.
  int Check(const std::string& file) {
    std::string message;
    PKG_ERRCODE code = PKG_OK;
    Json::Value details;
    PackageInfo info;
    bool ok = CheckPackageFileInfoImpl("enu", file, message, code, details, info);
    EXPECT_EQ(ok, code == PKG_OK) << message;
    return code;
  }
  int Install(const std::string& file) {
    std::string message;
    PKG_ERRCODE code = PKG_OK;
    Json::Value details;
    bool ok = InstallPackageFileImpl("root", file, "", 0, "", false, "enu", message, code, details,
                                     true, true);
    EXPECT_EQ(ok, code == PKG_OK) << message;
    return code;
  }
  // Nothing of a refused package reached the system.
  void ExpectUntouched() {
    EXPECT_TRUE(PackageRegistry::List().empty());
    std::string out;
    RunProgram(
        {"find", root_.Path("/volume1"), root_.Path("/var/packages"), "-mindepth", "1", "-not",
         "-name", ".records", "-not", "-name", "@appstore", "-not", "-name", "@appdata"},
        &out);
    EXPECT_EQ("", out);
  }

  TempRoot root_;
  std::string dir_;
};

TEST_F(PackageFileTest, HostilePayloadsAreRefusedBeforeInstalling) {
  const std::vector<std::vector<RawEntry>> hostile = {
      {{"../escape.txt", 'f', 0644, ""}},
      {{"/etc/cron.d/evil", 'f', 0644, ""}},
      {{"a/../../escape", 'f', 0644, ""}},
      {{"etc", 'l', 0777, "/etc"}},
      {{"a", 'd', 0755, ""}, {"a/up", 'l', 0777, "../.."}},
      {{"b", 'l', 0777, "c"}, {"c", 'l', 0777, "../../etc"}},
      {{"x", 'f', 0644, ""}, {"hard", 'h', 0644, "x"}},
      {{"dev/null", 'c', 0666, ""}},
      {{"bin/su", 'f', 04755, ""}},
      {{"bin/sg", 'f', 02755, ""}},
  };
  for (size_t i = 0; i < hostile.size(); ++i) {
    std::string file = BuildRawPackage(dir_, "hostile" + std::to_string(i), hostile[i]);
    EXPECT_EQ(PKG_ERR_HOSTILE_MEMBER, Check(file)) << "case " << i;
    EXPECT_EQ(PKG_ERR_HOSTILE_MEMBER, Install(file)) << "case " << i;
  }
  ExpectUntouched();
  EXPECT_FALSE(KLIBCFileExist(root_.Path("/escape.txt").c_str()));
  EXPECT_FALSE(KLIBCFileExist(root_.Path("/tmp/escape.txt").c_str()));
  // Symlinks that stay inside are fine.
  std::string fine = BuildRawPackage(
      dir_, "fine",
      {{"lib", 'd', 0755, ""}, {"lib/x", 'f', 0644, ""}, {"current", 'l', 0777, "lib/x"}});
  EXPECT_EQ(PKG_OK, Check(fine));
}

TEST_F(PackageFileTest, DamagedFilesAreNotPackageFiles) {
  TestPackage app;
  std::string good = app.Build(dir_);
  std::string data;
  ASSERT_TRUE(KIVOReadFile(good, &data));

  std::string truncated = dir_ + "/truncated.kpk";
  ASSERT_TRUE(KIVOWriteFileAtomic(truncated, data.substr(0, data.size() / 2), SyncToDisk::No));
  EXPECT_EQ(PKG_ERR_NOT_PACKAGE_FILE, Check(truncated));
  std::string garbage = dir_ + "/garbage.kpk";
  ASSERT_TRUE(KIVOWriteFileAtomic(garbage, std::string(5000, '\x42'), SyncToDisk::No));
  EXPECT_EQ(PKG_ERR_NOT_PACKAGE_FILE, Check(garbage));
  EXPECT_EQ(PKG_ERR_NOT_PACKAGE_FILE, Check(dir_ + "/missing.kpk"));

  std::string payload = dir_ + "/p.tgz";
  ASSERT_TRUE(KIVOWriteFileAtomic(payload, "", SyncToDisk::No));
  std::string error, huge = dir_ + "/huge-info.kpk";
  std::string info = "package=\"huge\"\nversion=\"1\"\n# " + std::string(70 << 10, 'x') + "\n";
  ASSERT_TRUE(PMSWritePackage({{"INFO", info}}, payload, "", huge, &error)) << error;
  EXPECT_EQ(PKG_ERR_NOT_PACKAGE_FILE, Check(huge));

  std::string unknown = dir_ + "/unknown-member.kpk";
  ASSERT_TRUE(PMSWritePackage({{"INFO", "package=\"u\"\nversion=\"1\"\n"}, {"../../x", "y"}},
                              payload, "", unknown, &error));
  EXPECT_EQ(PKG_ERR_HOSTILE_MEMBER, Check(unknown));
  ExpectUntouched();
}

TEST_F(PackageFileTest, AnyMemberChangedAfterSigningIsABadSignature) {
  TestKeys keys(root_.Path("/tmp"));
  std::string publisher = keys.Create("Publisher <publisher@test.invalid>");
  keys.Trust(publisher);
  SetTrustLevel(0);
  TestPackage app;
  app.files = {{"big.txt", std::string(20000, 'a')}};
  app.scripts = {{"postinst", "exit 0\n"}};
  std::string file = app.Build(dir_);
  keys.Sign(file, publisher);
  ASSERT_EQ(PKG_OK, Check(file));
  std::string data;
  ASSERT_TRUE(KIVOReadFile(file, &data));
  // Each change keeps every length, so the archive stays a sound tar and
  // only the member's content differs from what was signed.
  auto tamper = [&](const std::string& name, size_t at, char value) {
    std::string bytes = data;
    bytes[at] = value;
    std::string out = dir_ + "/tampered-" + name + ".kpk";
    EXPECT_TRUE(KIVOWriteFileAtomic(out, bytes, SyncToDisk::No));
    return out;
  };
  size_t version = data.find("version=\"1.0\"");
  size_t script = data.find("exit 0");
  size_t payload = data.find("\x1f\x8b\x08", data.find("package.tgz"));
  ASSERT_NE(std::string::npos, version);
  ASSERT_NE(std::string::npos, script);
  ASSERT_NE(std::string::npos, payload);
  for (const std::string& tampered :
       {tamper("info", version + 9, '2'), tamper("script", script + 5, '1'),
        tamper("payload", payload + 40, static_cast<char>(data[payload + 40] ^ 0x55))}) {
    EXPECT_EQ(PKG_ERR_BAD_SIGNATURE, Check(tampered)) << tampered;
    EXPECT_EQ(PKG_ERR_BAD_SIGNATURE, Install(tampered)) << tampered;
    std::string out;
    EXPECT_EQ(1, Kivoctl({"inspect", tampered}, &out));
    EXPECT_NE(std::string::npos, out.find("[289]")) << out;
  }
  ExpectUntouched();
}

TEST_F(PackageFileTest, PermissionBitsAreKept) {
  std::string file = BuildRawPackage(dir_, "modes",
                                     {{"shared", 'd', 01777, ""},
                                      {"shared/open", 'f', 0666, ""},
                                      {"private", 'd', 0700, ""},
                                      {"private/tool", 'f', 0750, ""},
                                      {"readonly", 'f', 0444, ""}});
  ASSERT_EQ(PKG_OK, Install(file));
  std::string target = PackageRegistry::RecordDir("modes") + "/target/";
  auto mode = [&](const std::string& path) {
    struct stat st;
    EXPECT_EQ(0, lstat((target + path).c_str(), &st)) << path;
    return st.st_mode & 07777;
  };
  EXPECT_EQ(01777u, mode("shared"));
  EXPECT_EQ(0666u, mode("shared/open"));
  EXPECT_EQ(0700u, mode("private"));
  EXPECT_EQ(0750u, mode("private/tool"));
  EXPECT_EQ(0644u, mode("readonly"));  // the owner may always write
}

// Runs `kivoctl build` as an unprivileged user when this test is root, so
// that a file without permissions really cannot be opened.
int BuildAsUser(const std::string& src, const std::string& out, std::string* output) {
  std::vector<std::string> argv = {BuildDir() + "/bin/kivoctl", "build", src, out};
  if (getuid() == 0)
    argv.insert(argv.begin(), {"setpriv", "--reuid=65534", "--regid=65534", "--clear-groups"});
  return RunProgram(argv, output);
}

TEST_F(PackageFileTest, BuildFailsWhenAFileCannotBeRead) {
  // A folder of its own that the unprivileged user may enter and write.
  std::string dir = root_.Path("/tmp/build-as-user");
  ASSERT_EQ(0, KIVOFSMkdirP(dir.c_str()));
  ASSERT_EQ(0, chmod(root_.dir().c_str(), 0755));
  ASSERT_EQ(0, chmod(root_.Path("/tmp").c_str(), 0755));
  ASSERT_EQ(0, chmod(dir.c_str(), 0777));
  TestPackage app;
  app.files = {{"readable", "fine\n"}, {"secret", "no one may read this\n"}};
  app.members = {{"LICENSE", "Use it well.\n"}};
  std::string good = app.Build(dir);
  ASSERT_EQ(0, chmod(good.c_str(), 0666));
  std::string src = dir + "/src-" + app.id + "-" + app.version;
  ASSERT_EQ(0, RunProgram({"chmod", "-R", "a+rwX", src}, nullptr));
  std::string out, built = dir + "/rebuilt.kpk";
  ASSERT_EQ(0, BuildAsUser(src, built, &out)) << out;
  ASSERT_EQ(0, unlink(built.c_str()));

  for (const std::string& unreadable : {src + "/package/secret", src + "/LICENSE"}) {
    ASSERT_EQ(0, chmod(unreadable.c_str(), 0));
    EXPECT_EQ(1, BuildAsUser(src, built, &out)) << unreadable;
    EXPECT_NE(std::string::npos, out.find("cannot")) << out;
    EXPECT_FALSE(KLIBCFileExist(built.c_str())) << unreadable;
    std::string listing;
    RunProgram({"sh", "-c", "ls '" + dir + "' | grep -v '^src-' | grep -v '.kpk$'"}, &listing);
    EXPECT_EQ("", listing) << "temporary files left: " << listing;
    ASSERT_EQ(0, chmod(unreadable.c_str(), 0644));
  }
  // A folder that cannot be listed is not an empty one.
  ASSERT_EQ(0, chmod((src + "/package").c_str(), 0311));
  EXPECT_EQ(1, BuildAsUser(src, built, &out));
  EXPECT_NE(std::string::npos, out.find("cannot read the folder")) << out;
  EXPECT_FALSE(KLIBCFileExist(built.c_str()));
}

TEST_F(PackageFileTest, SignaturesByTrustLevel) {
  TestKeys keys(root_.Path("/tmp"));
  std::string good = keys.Create("Good Publisher <good@test.invalid>");
  std::string stranger = keys.Create("Stranger <stranger@test.invalid>");
  std::string expired = keys.Create("Old Publisher <old@test.invalid>", true);
  std::string revoked = keys.Create("Lost Key <lost@test.invalid>");
  keys.Trust(good);
  keys.Trust(expired);

  auto package = [&](const std::string& id) {
    TestPackage p;
    p.id = id;
    return p.Build(dir_);
  };
  std::string signed_good = package("signed-good");
  keys.Sign(signed_good, good);
  std::string by_stranger = package("by-stranger");
  keys.Sign(by_stranger, stranger);
  std::string by_expired = package("by-expired");
  keys.Sign(by_expired, expired, true);
  // Signed while the key was good; the key was revoked since.
  std::string by_revoked = package("by-revoked");
  keys.Sign(by_revoked, revoked);
  keys.Revoke(revoked);
  keys.Trust(revoked);
  std::string unsigned_pkg = package("unsigned");
  std::string no_signature = package("empty-signature");
  std::string error;
  ASSERT_TRUE(PMSAttachSignature(no_signature, no_signature, "this is not a signature\n", &error));
  std::string wrong_manifest = package("wrong-manifest");
  keys.Sign(wrong_manifest, good);
  {  // A valid signature of another package's MANIFEST.
    std::string other = package("other");
    keys.Sign(other, good);
    std::string data;
    ASSERT_TRUE(KIVOReadFile(other, &data));
    size_t begin = data.find("-----BEGIN PGP SIGNATURE");
    size_t end = data.find("-----END PGP SIGNATURE-----") + 28;
    ASSERT_TRUE(PMSAttachSignature(wrong_manifest, wrong_manifest, data.substr(begin, end - begin),
                                   &error));
  }

  SetTrustLevel(0);
  EXPECT_EQ(PKG_OK, Check(signed_good));
  EXPECT_EQ(PKG_ERR_UNKNOWN_SIGNER, Check(by_stranger));
  EXPECT_EQ(PKG_ERR_EXPIRED_KEY, Check(by_expired));
  EXPECT_EQ(PKG_ERR_REVOKED_KEY, Check(by_revoked));
  EXPECT_EQ(PKG_ERR_NO_SIGNATURE, Check(unsigned_pkg));
  EXPECT_EQ(PKG_ERR_BAD_SIGNATURE, Check(no_signature));
  EXPECT_EQ(PKG_ERR_BAD_SIGNATURE, Check(wrong_manifest));
  EXPECT_EQ(PKG_ERR_NO_SIGNATURE, Install(unsigned_pkg));
  EXPECT_TRUE(PackageRegistry::List().empty());

  SetTrustLevel(1);
  EXPECT_EQ(PKG_OK, Check(unsigned_pkg));
  EXPECT_EQ(PKG_ERR_UNKNOWN_SIGNER, Check(by_stranger));

  SetTrustLevel(2);
  EXPECT_EQ(PKG_OK, Check(by_stranger));
  EXPECT_EQ(PKG_OK, Check(by_expired));
  EXPECT_EQ(PKG_ERR_REVOKED_KEY, Check(by_revoked));
  EXPECT_EQ(PKG_ERR_BAD_SIGNATURE, Check(no_signature));
  EXPECT_EQ(PKG_OK, Install(signed_good));
}

TEST_F(PackageFileTest, BuildTellsTheAuthorWhatIsWrong) {
  struct Case {
    std::string info;
    std::string expected;
  } cases[] = {
      {"version=\"1\"\n", "package: required"},
      {"package=\"../x\"\nversion=\"1\"\n", "package: required"},
      {"package=\"a\"\n", "version: required"},
      {"package=\"a\"\nversion=\"1\"\nbeta=\"maybe\"\n", "beta: must be yes or no"},
      {"package=\"a\"\nversion=\"1\"\nos_min_ver=\"7\"\n", "os_min_ver: must look like"},
      {"package=\"a\"\nversion=\"1\"\nadminport=\"99999\"\n", "adminport"},
      {"package=\"a\"\nversion=\"1\"\nlogfile=\"../../etc/shadow\"\n", "logfile"},
      {"package=\"a\"\nversion=\"1\"\ninstall_dep_packages=\"b>>1\"\n", "install_dep_packages"},
      {"package=\"a\"\nversion=\"1\"\nextractsize=\"lots\"\n", "extractsize: must be a number"},
      {"package=\"a\"\nversion=\"1\"\ndescription=\"\x1b[2J\"\n", "description: holds a control"},
  };
  for (const Case& c : cases) {
    std::string src = dir_ + "/bad-src";
    RunProgram({"rm", "-rf", src}, nullptr);
    root_.Write(src.substr(root_.dir().size()) + "/INFO", c.info);
    ASSERT_EQ(0, KIVOFSMkdirP((src + "/package").c_str()));
    std::string error;
    EXPECT_FALSE(PMSBuildPackage(src, dir_ + "/bad.kpk", BuildOptions(), &error));
    EXPECT_NE(std::string::npos, error.find(c.expected)) << c.info << " -> " << error;
  }
}

}  // namespace
