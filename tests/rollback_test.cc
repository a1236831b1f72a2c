// Kept earlier versions and rollbacks, through kivoctl on a temporary root:
// an upgrade keeps the version it replaced with its data, a rollback brings
// that version back with its data byte for byte, a second rollback undoes
// the first, and keep_revisions, drop-revision and uninstall decide how
// long a kept version stays.

#include <algorithm>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

// What v1 keeps: files of several kinds and modes, a subfolder, a symlink,
// a hard link and 3 MB that a kept copy takes room for.
const char kWriteData[] =
    "D=\"$KIVO_PKG_VAR\"\n"
    "mkdir -p \"$D/db/journal\"\n"
    "printf 'row1\\000row2\\377\\n' > \"$D/db/main.db\"\n"
    "echo 'entry' > \"$D/db/journal/0001\"\n"
    "echo 'secret=1' > \"$D/config\"; chmod 600 \"$D/config\"\n"
    "ln -s db/main.db \"$D/current\"\n"
    "ln \"$D/config\" \"$D/config.bak\"\n"
    "head -c 3000000 /dev/urandom > \"$D/big\"\n"
    "touch -d '2001-02-03 04:05:06' \"$D/db/journal/0001\" \"$D/db\"\n";

// What v2's migration does to it.
const char kRewriteData[] =
    "D=\"$KIVO_PKG_VAR\"\n"
    "echo 'migrated' > \"$D/db/main.db\"\n"
    "rm -rf \"$D/db/journal\" \"$D/current\"\n"
    "echo 'new' > \"$D/v2-only\"\n"
    "chmod 644 \"$D/config\"\n";

class RollbackTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"1\"\n");
    dir_ = root_.Path("/tmp/packages");
    data_ = root_.Path("/volume1/@appdata/test-app");
    ASSERT_EQ(0, KIVOFSMkdirP(dir_.c_str()));
    v1_.files = {{"version.txt", "1\n"}};
    v1_.scripts = {{"postinst", kWriteData}};
    v2_ = v1_;
    v2_.version = "2.0";
    v2_.files = {{"version.txt", "2\n"}};
    v2_.scripts = {{"postupgrade", kRewriteData}};
  }
  void TearDown() override { StopInstalledPackages(); }

  int Install(const TestPackage& p, std::vector<std::string> extra = {}) {
    std::vector<std::string> args = {"install", p.Build(dir_)};
    args.insert(args.end(), extra.begin(), extra.end());
    return Kivoctl(args, &out_);
  }
  int Tool(const std::string& command) { return Kivoctl({command, "test-app"}, &out_); }
  void ExpectSaid(const std::string& words) {
    EXPECT_NE(std::string::npos, out_.find(words)) << "missing: " << words << "\n" << out_;
  }
  std::string Status() {
    std::string out;
    Kivoctl({"status", "test-app"}, &out);
    return out;
  }
  std::string Code() { return FileText(root_.Path("/var/packages/test-app/target/version.txt")); }
  // Every entry of the data folder but the daemon's pid file: path, type,
  // mode, owner, size, times, links, link target and content digest, so
  // that two equal answers mean the same data byte for byte.
  std::string Fingerprint() {
    std::string listing, digests;
    RunProgram({"sh", "-c",
                "find \"$1\" -mindepth 1 -not -name daemon.pid -printf "
                "'%P|%y|%m|%U:%G|%s|%T@|%n|%l\\n' | sort",
                "sh", data_},
               &listing);
    RunProgram({"sh", "-c",
                "cd \"$1\" && find . -type f -not -name daemon.pid -exec sha256sum {} + | sort",
                "sh", data_},
               &digests);
    return listing + digests;
  }
  // Only installed packages and `kept` earlier versions hold records,
  // payloads and copies of data.
  void ExpectHeld(size_t kept) {
    const DataCopies copies = ListDataCopies(root_.Path("/volume1/@appdata/.snapshots"));
    EXPECT_EQ(kept, copies.kept);
    EXPECT_EQ(kept, copies.entries.size());
    const size_t installed = PackageRegistry::List().size();
    for (const char* dir : {"/var/packages/.records", "/volume1/@appstore"}) {
      std::string names;
      RunProgram({"ls", "-A", root_.Path(dir)}, &names);
      EXPECT_EQ(installed + kept, static_cast<size_t>(std::count(names.begin(), names.end(), '\n')))
          << dir << ":\n"
          << names;
    }
  }

  TempRoot root_;
  std::string dir_, data_, out_;
  TestPackage v1_, v2_;
};

TEST_F(RollbackTest, RollbackBringsTheOldVersionBackWithItsDataAndASecondOneUndoesIt) {
  ASSERT_EQ(0, Install(v1_, {"--run"})) << out_;
  const std::string v1_data = Fingerprint();
  ASSERT_NE(std::string::npos, v1_data.find("db/journal/0001|f|644")) << v1_data;
  ASSERT_EQ(0, Install(v2_)) << out_;
  const std::string v2_data = Fingerprint();
  ASSERT_NE(v1_data, v2_data);
  EXPECT_EQ("test-app 2.0 running\n", Status());
  ExpectHeld(1);

  ASSERT_EQ(0, Tool("revisions")) << out_;
  ExpectSaid("test-app 1.0 replaced ");

  ASSERT_EQ(0, Tool("rollback")) << out_;
  ExpectSaid("test-app 2.0 was rolled back by");
  EXPECT_EQ("test-app 1.0 running\n", Status());
  EXPECT_EQ("1\n", Code());
  EXPECT_EQ(v1_data, Fingerprint());
  ASSERT_EQ(0, Tool("revisions")) << out_;
  ExpectSaid("test-app 2.0 replaced ");
  ExpectHeld(1);

  ASSERT_EQ(0, Tool("rollback")) << out_;
  EXPECT_EQ("test-app 2.0 running\n", Status());
  EXPECT_EQ("2\n", Code());
  EXPECT_EQ(v2_data, Fingerprint());
  ExpectHeld(1);
}

TEST_F(RollbackTest, StoppedPackageIsRolledBackStopped) {
  ASSERT_EQ(0, Install(v1_)) << out_;
  ASSERT_EQ(0, Install(v2_)) << out_;
  ASSERT_EQ(0, Tool("rollback")) << out_;
  EXPECT_EQ("test-app 1.0 stopped\n", Status());
  EXPECT_EQ(std::string("row1\0row2\xff\n", 11), FileText(data_ + "/db/main.db"));
  EXPECT_FALSE(KLIBCFileExist((data_ + "/v2-only").c_str()));
}

TEST_F(RollbackTest, KeepRevisionsZeroKeepsNothingAndRollbackIsRefusedInWords) {
  root_.Write("/etc/kivo/pkgtool.conf", "keep_revisions=\"0\"\n");
  ASSERT_EQ(0, Install(v1_)) << out_;
  ASSERT_EQ(0, Install(v2_)) << out_;
  ExpectHeld(0);
  const std::string v2_data = Fingerprint();

  ASSERT_EQ(0, Tool("revisions")) << out_;
  ExpectSaid("no earlier version of test-app is kept");
  EXPECT_EQ(1, Tool("rollback")) << out_;
  ExpectSaid(
      "no earlier version of test-app is kept to roll back to (keep_revisions is 0 in "
      "/etc/kivo/pkgtool.conf: upgrades keep none); nothing was changed");
  ExpectSaid("[" + std::to_string(PKG_ERR_NO_REVISION) + "]");
  EXPECT_EQ("test-app 2.0 stopped\n", Status());
  EXPECT_EQ(v2_data, Fingerprint());
}

TEST_F(RollbackTest, OnlyTheNewestReplacedVersionIsKept) {
  ASSERT_EQ(0, Install(v1_)) << out_;
  ASSERT_EQ(0, Install(v2_)) << out_;
  TestPackage v3 = v2_;
  v3.version = "3.0";
  v3.files = {{"version.txt", "3\n"}};
  v3.scripts = {{"postupgrade", "echo 'v3' > \"$KIVO_PKG_VAR/db/main.db\"\n"}};
  ASSERT_EQ(0, Install(v3)) << out_;
  ExpectHeld(1);
  ASSERT_EQ(0, Tool("revisions")) << out_;
  ExpectSaid("test-app 2.0 replaced ");
  EXPECT_EQ(std::string::npos, out_.find("test-app 1.0")) << out_;

  ASSERT_EQ(0, Tool("rollback")) << out_;
  EXPECT_EQ("test-app 2.0 stopped\n", Status());
  EXPECT_EQ("migrated\n", FileText(data_ + "/db/main.db"));
}

TEST_F(RollbackTest, DropRevisionFreesTheRoomItsCopyTook) {
  ASSERT_EQ(0, Install(v1_)) << out_;
  ASSERT_EQ(0, Install(v2_)) << out_;
  ASSERT_EQ(0, Tool("revisions")) << out_;
  const size_t takes = out_.find(", takes ");
  ASSERT_NE(std::string::npos, takes) << out_;
  // The copy holds the 3 MB file and the payload a few blocks.
  EXPECT_GE(std::atoll(out_.c_str() + takes + 8), 3000000) << out_;

  ASSERT_EQ(0, Tool("drop-revision")) << out_;
  ExpectSaid("dropped test-app 1.0 and its data, ");
  ExpectHeld(0);
  EXPECT_FALSE(KLIBCFileExist(root_.Path("/volume1/@appdata/.snapshots").c_str()));
  EXPECT_EQ(1, Tool("rollback")) << out_;
  ExpectSaid("no earlier version of test-app is kept to roll back to; nothing was changed");
  EXPECT_EQ(1, Tool("drop-revision")) << out_;
  ExpectSaid("[" + std::to_string(PKG_ERR_NO_REVISION) + "]");
  EXPECT_EQ("test-app 2.0 stopped\n", Status());
}

TEST_F(RollbackTest, UninstallTakesTheKeptVersionWithIt) {
  ASSERT_EQ(0, Install(v1_)) << out_;
  ASSERT_EQ(0, Install(v2_)) << out_;
  ExpectHeld(1);
  ASSERT_EQ(0, Tool("uninstall")) << out_;
  ExpectHeld(0);
  EXPECT_EQ(1, Tool("rollback")) << out_;
  ExpectSaid("[" + std::to_string(PKG_ERR_NOT_INSTALLED) + "]");
}

// A kept copy whose record says nothing true of it is no revision: it is
// never rolled back to, and the next operation removes it.
TEST_F(RollbackTest, KeptVersionThatIsNotWholeIsNotTrusted) {
  ASSERT_EQ(0, Install(v1_)) << out_;
  ASSERT_EQ(0, Install(v2_)) << out_;
  std::string record;
  ASSERT_EQ(0, RunProgram({"sh", "-c", "cd \"$1\" && ls -d test-app.*.kept", "sh",
                           root_.Path("/volume1/@appdata/.snapshots/test-app")},
                          &record))
      << record;
  record = record.substr(0, record.size() - 6);  // "<record>.kept\n"
  root_.Write("/var/packages/.records/" + record + "/REPLACED", "yesterday\n");
  ASSERT_EQ(0, Tool("revisions")) << out_;
  ExpectSaid("no earlier version of test-app is kept");
  EXPECT_EQ(1, Tool("rollback")) << out_;
  ExpectSaid("[" + std::to_string(PKG_ERR_NO_REVISION) + "]");
  EXPECT_EQ("test-app 2.0 stopped\n", Status());
  EXPECT_EQ("migrated\n", FileText(data_ + "/db/main.db"));
  ASSERT_EQ(0, Install(PackageWithInfo("other-app"))) << out_;
  ExpectHeld(0);
}

}  // namespace
