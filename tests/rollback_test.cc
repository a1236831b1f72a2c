// Kept earlier versions and rollbacks, through kivoctl on a temporary root:
// an upgrade keeps the version it replaced with its data, a rollback brings
// that version back with its data byte for byte, a second rollback undoes
// the first, and keep_revisions, drop-revision and uninstall decide how
// long a kept version stays.

#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "pkgtool/result_codes.h"
#include "testing/upgrade_fixture.h"

namespace {

class RollbackTest : public UpgradeFixture {
 protected:
  void SetUp() override {
    UpgradeFixture::SetUp();
    // 3 MB more, that a kept copy takes room for.
    v1_.scripts = {{"postinst", std::string(kWriteTestData) +
                                    "head -c 3000000 /dev/urandom > \"$KIVO_PKG_VAR/big\"\n"}};
    v2_.scripts = {{"postupgrade", kRewriteTestData}};
    fingerprint_folder_itself_ = false;
  }

  int Tool(const std::string& command) { return Kivoctl({command, "test-app"}, &out_); }
  std::string Code() { return FileText(root_.Path("/var/packages/test-app/target/version.txt")); }
  // The record name of the one version kept.
  std::string KeptRecord() {
    std::string record;
    EXPECT_EQ(0, RunProgram({"sh", "-c", "cd \"$1\" && ls -d test-app.*.kept", "sh",
                             root_.Path("/volume1/@appdata/.snapshots/test-app")},
                            &record))
        << record;
    return record.substr(0, record.size() - 6);  // "<record>.kept\n"
  }
};

TEST_F(RollbackTest, RollbackBringsTheOldVersionBackWithItsDataAndASecondOneUndoesIt) {
  ASSERT_EQ(0, Install(v1_, {"--run"})) << out_;
  const std::string v1_data = Fingerprint();
  ASSERT_NE(std::string::npos, v1_data.find("db/journal/0001|f|644")) << v1_data;
  ASSERT_EQ(0, Install(v2_)) << out_;
  const std::string v2_data = Fingerprint();
  ASSERT_NE(v1_data, v2_data);
  EXPECT_EQ("test-app 2.0 running\n", Status());
  ExpectNothingLeftBut(1);

  ASSERT_EQ(0, Tool("revisions")) << out_;
  ExpectSaid("test-app 1.0 replaced ");

  ASSERT_EQ(0, Tool("rollback")) << out_;
  ExpectSaid("test-app 2.0 was rolled back by");
  EXPECT_EQ("test-app 1.0 running\n", Status());
  EXPECT_EQ("1\n", Code());
  EXPECT_EQ(v1_data, Fingerprint());
  ASSERT_EQ(0, Tool("revisions")) << out_;
  ExpectSaid("test-app 2.0 replaced ");
  ExpectNothingLeftBut(1);

  ASSERT_EQ(0, Tool("rollback")) << out_;
  EXPECT_EQ("test-app 2.0 running\n", Status());
  EXPECT_EQ("2\n", Code());
  EXPECT_EQ(v2_data, Fingerprint());
  ExpectNothingLeftBut(1);
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
  ExpectNothingLeftBut(0);
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
  ExpectNothingLeftBut(1);
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
  ExpectNothingLeftBut(0);
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
  ExpectNothingLeftBut(1);
  ASSERT_EQ(0, Tool("uninstall")) << out_;
  ExpectNothingLeftBut(0);
  EXPECT_EQ(1, Tool("rollback")) << out_;
  ExpectSaid("[" + std::to_string(PKG_ERR_NOT_INSTALLED) + "]");
}

// A kept copy whose record says nothing true of it is no revision: it is
// never rolled back to, and the next operation removes it.
TEST_F(RollbackTest, KeptVersionThatIsNotWholeIsNotTrusted) {
  ASSERT_EQ(0, Install(v1_)) << out_;
  ASSERT_EQ(0, Install(v2_)) << out_;
  const std::string record = KeptRecord();
  root_.Write("/var/packages/.records/" + record + "/REPLACED", "yesterday\n");
  ASSERT_EQ(0, Tool("revisions")) << out_;
  ExpectSaid("no earlier version of test-app is kept");
  EXPECT_EQ(1, Tool("rollback")) << out_;
  ExpectSaid("[" + std::to_string(PKG_ERR_NO_REVISION) + "]");
  EXPECT_EQ("test-app 2.0 stopped\n", Status());
  EXPECT_EQ("migrated\n", FileText(data_ + "/db/main.db"));
  ASSERT_EQ(0, Install(PackageWithInfo("other-app"))) << out_;
  ExpectNothingLeftBut(0);
}

// Dropping a kept version renames its copy without waiting for the volume,
// then removes the copy, the payload and the record: a crash may keep any
// part of that. Whatever of the version stays without the rest is removed
// by the next operation, and never offered for a rollback.
TEST_F(RollbackTest, KeptVersionHalfDroppedInACrashIsRemovedByTheNextOperation) {
  ASSERT_EQ(0, Install(v1_)) << out_;
  ASSERT_EQ(0, Install(v2_)) << out_;
  std::string out;
  // The record's removal stayed, the rest was lost.
  ASSERT_EQ(0,
            RunProgram({"rm", "-rf", root_.Path("/var/packages/.records/" + KeptRecord())}, &out))
      << out;
  ASSERT_EQ(0, Tool("revisions")) << out_;
  ExpectSaid("no earlier version of test-app is kept");
  ASSERT_EQ(0, Install(PackageWithInfo("other-app"))) << out_;
  ExpectNothingLeftBut(0);

  // The copy's removal stayed, the record and the payload were lost.
  TestPackage v3 = v2_;
  v3.version = "3.0";
  ASSERT_EQ(0, Install(v3)) << out_;
  const std::string copy =
      root_.Path("/volume1/@appdata/.snapshots/test-app/" + KeptRecord() + ".kept");
  ASSERT_EQ(0, RunProgram({"rm", "-rf", copy}, &out)) << out;
  EXPECT_EQ(1, Tool("rollback")) << out_;
  ExpectSaid("[" + std::to_string(PKG_ERR_NO_REVISION) + "]");
  EXPECT_EQ("2\n", Code());
  ASSERT_EQ(0, Install(PackageWithInfo("another-app"))) << out_;
  ExpectNothingLeftBut(0);
}

}  // namespace
