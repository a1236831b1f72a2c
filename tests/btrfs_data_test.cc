// Package data on a Btrfs volume, through kivoctl on a temporary root whose
// /volume1 is a Btrfs file system in a loop-mounted file: the data folder is
// made a subvolume, the safety copy before an upgrade is a snapshot, and
// restore, rollback, uninstall and the recovery after a kill -9 work on
// subvolumes as they do on folders. Needs root, a loop device and
// mkfs.btrfs (Debian's btrfs-progs); skipped, saying why, without them.

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "pkgtool/btrfs_subvolume.h"
#include "testing/upgrade_fixture.h"

namespace {

class BtrfsDataTest : public UpgradeFixture {
 protected:
  void SetUp() override {
    UpgradeFixture::SetUp();
    const std::string why = MountBtrfs();
    if (!why.empty()) {
      GTEST_SKIP() << "no Btrfs volume for this test: " << why;
    }
    v2_.scripts = {{"postupgrade", kRewriteTestData}};
  }

  void TearDown() override {
    UpgradeFixture::TearDown();
    if (!mounted_) return;
    // mount -o loop detaches the loop device when it is unmounted; a busy
    // mount is detached lazily so that the root can still be removed.
    const std::string volume = root_.Path("/volume1");
    if (umount(volume.c_str()) != 0) {
      EXPECT_EQ(0, umount2(volume.c_str(), MNT_DETACH)) << strerror(errno);
    }
  }

  // Mounts a fresh Btrfs file system on /volume1; "" when it did, else why not.
  std::string MountBtrfs() {
    if (geteuid() != 0) return "not root";
    if (access("/dev/loop-control", F_OK) != 0) return "no loop device";
    std::string out;
    if (RunProgram({"sh", "-c", "command -v mkfs.btrfs"}, &out) != 0) {
      return "mkfs.btrfs is not installed (Debian package btrfs-progs)";
    }
    const std::string image = root_.Path("/btrfs.img");
    if (RunProgram({"truncate", "-s", "256M", image}, &out) != 0 ||
        RunProgram({"mkfs.btrfs", "-q", image}, &out) != 0) {
      return "cannot make the file system: " + out;
    }
    if (RunProgram({"mount", "-o", "loop", image, root_.Path("/volume1")}, &out) != 0) {
      return "cannot mount it: " + out;
    }
    mounted_ = true;
    return "";
  }

  int Tool(const std::string& command) { return Kivoctl({command, "test-app"}, &out_); }
  // The installed code is version `code` ("1", "2") over the data `data`
  // (a Fingerprint).
  void ExpectVersion(const std::string& code, const std::string& data) {
    EXPECT_EQ(code + "\n", Code());
    EXPECT_EQ(data, Fingerprint());
  }
  // Another package's install: an operation that first cleans up what a
  // crash left.
  int InstallAnother() {
    TestPackage other = v1_;
    other.id = "other-app";
    other.scripts = {};
    return Install(other);
  }
  std::string Code() { return FileText(root_.Path("/var/packages/test-app/target/version.txt")); }
  std::string Snapshots() { return root_.Path("/volume1/@appdata/.snapshots/test-app"); }
  // The one copy kept of the version replaced last, a subvolume or not.
  std::string KeptCopy() {
    std::string names = Entries("/volume1/@appdata/.snapshots/test-app");
    EXPECT_EQ(1, std::count(names.begin(), names.end(), '\n')) << names;
    names.erase(names.find('\n'));
    return Snapshots() + "/" + names;
  }
  // The subvolumes of the volume, one a line.
  std::string Subvolumes() {
    std::string out;
    EXPECT_EQ(0, RunProgram({"btrfs", "subvolume", "list", "-o", root_.Path("/volume1")}, &out))
        << out;
    return out;
  }

  // 1.0 installed and running, with a file of root's in its data, as a
  // version that ran as root would leave it: an upgrade gives it to the
  // package's account.
  void RunWithAFileOfRoots() {
    fingerprint_folder_itself_ = false;  // the daemon's pid file changes it
    ASSERT_EQ(0, Install(v1_, {"--run"})) << out_;
    ASSERT_TRUE(KIVOWriteFileAtomic(data_ + "/left-by-root", "root's\n", SyncToDisk::No));
    ASSERT_EQ(0, lchown((data_ + "/left-by-root").c_str(), 0, 0));
  }

  bool mounted_ = false;
};

TEST_F(BtrfsDataTest, DataFolderIsASubvolumeAndTheUpgradeCopyASnapshot) {
  ASSERT_EQ(0, Install(v1_)) << out_;
  EXPECT_TRUE(PMSIsSubvolume(data_));
  const std::string v1_data = Fingerprint();
  ASSERT_EQ(0, Install(v2_)) << out_;
  EXPECT_TRUE(PMSIsSubvolume(data_));
  const std::string kept = KeptCopy();
  EXPECT_TRUE(PMSIsSubvolume(kept)) << kept;
  // The snapshot holds the data as 1.0 left it, byte for byte.
  const std::string v2_data = Fingerprint();
  const std::string saved = data_;
  data_ = kept;
  EXPECT_EQ(v1_data, Fingerprint());
  data_ = saved;
  EXPECT_NE(v1_data, v2_data);
  ExpectNothingLeftBut(1);
}

TEST_F(BtrfsDataTest, FailedUpgradePutsTheSnapshotBackByteForByte) {
  ASSERT_EQ(0, Install(v1_)) << out_;
  const std::string v1_data = Fingerprint();
  TestPackage broken = v2_;
  broken.scripts = {{"postupgrade", std::string(kRewriteTestData) + "exit 1\n"}};
  EXPECT_NE(0, Install(broken)) << out_;
  ExpectSaid("The upgrade to 2.0 failed in postupgrade; 1.0 and its data were restored.");
  ExpectVersion("1", v1_data);
  EXPECT_TRUE(PMSIsSubvolume(data_));
  ExpectNothingLeftBut(0);
}

TEST_F(BtrfsDataTest, RollbackAndItsUndo) {
  ASSERT_EQ(0, Install(v1_)) << out_;
  const std::string v1_data = Fingerprint();
  ASSERT_EQ(0, Install(v2_)) << out_;
  const std::string v2_data = Fingerprint();
  ASSERT_EQ(0, Tool("rollback")) << out_;
  ExpectVersion("1", v1_data);
  EXPECT_TRUE(PMSIsSubvolume(KeptCopy()));
  ExpectNothingLeftBut(1);
  ASSERT_EQ(0, Tool("rollback")) << out_;
  ExpectVersion("2", v2_data);
  ExpectNothingLeftBut(1);
}

// Killed after its commit, before the snapshot's rename reached the disk:
// the next operation makes the snapshot the kept revision.
TEST_F(BtrfsDataTest, UpgradeKilledAfterItsCommitKeepsItsSnapshot) {
  ASSERT_EQ(0, Install(v1_)) << out_;
  const std::string v1_data = Fingerprint();
  EXPECT_EQ(128 + 9,
            Kivoctl({"install", v2_.Build(dir_)}, &out_, {{"KIVO_PKGTOOL_FAULT", "confirmed"}}))
      << out_;
  const std::string v2_data = Fingerprint();
  ASSERT_EQ(0, InstallAnother()) << out_;
  ExpectVersion("2", v2_data);
  EXPECT_TRUE(PMSIsSubvolume(KeptCopy()));
  ExpectNothingLeftBut(1);
  ASSERT_EQ(0, Tool("rollback")) << out_;
  ExpectVersion("1", v1_data);
}

TEST_F(BtrfsDataTest, UninstallRemovesTheDataAndItsSnapshots) {
  ASSERT_EQ(0, Install(v1_)) << out_;
  ASSERT_EQ(0, Install(v2_)) << out_;
  EXPECT_NE("", Subvolumes());
  ASSERT_EQ(0, Tool("uninstall")) << out_;
  EXPECT_FALSE(KLIBCFileExist(data_.c_str()));
  ExpectNothingLeftBut(0);
  EXPECT_EQ("", Subvolumes());
}

// A data folder found in place as a plain folder stays one, and is copied
// file by file.
TEST_F(BtrfsDataTest, PlainDataFolderStaysPlain) {
  ASSERT_EQ(0, KIVOFSMkdirP(data_.c_str()));
  ASSERT_EQ(0, Install(v1_)) << out_;
  const std::string v1_data = Fingerprint();
  ASSERT_EQ(0, Install(v2_)) << out_;
  EXPECT_FALSE(PMSIsSubvolume(data_));
  EXPECT_FALSE(PMSIsSubvolume(KeptCopy()));
  ASSERT_EQ(0, Tool("rollback")) << out_;
  EXPECT_EQ(v1_data, Fingerprint());
}

// A snapshot would leave out a subvolume the package made inside its data
// folder: such a folder is copied file by file, and a failed upgrade still
// brings all of it back.
TEST_F(BtrfsDataTest, SubvolumeInsideTheDataIsCopiedFileByFile) {
  ASSERT_EQ(0, Install(v1_)) << out_;
  std::string out;
  ASSERT_EQ(0, RunProgram({"btrfs", "subvolume", "create", data_ + "/inner"}, &out)) << out;
  ASSERT_TRUE(KIVOWriteFileAtomic(data_ + "/inner/kept", "inner data\n", SyncToDisk::No));
  const std::string v1_data = Fingerprint();
  TestPackage broken = v2_;
  broken.scripts = {{"postupgrade", "echo lost > \"$KIVO_PKG_VAR/inner/kept\"; exit 1\n"}};
  EXPECT_NE(0, Install(broken)) << out_;
  EXPECT_EQ("inner data\n", FileText(data_ + "/inner/kept"));
  EXPECT_EQ(v1_data, Fingerprint());
  ExpectNothingLeftBut(0);
}

// A running package's snapshot is taken once it is stopped, while the
// upgrade gives its data to its account: the data the snapshot holds and a
// failed upgrade puts back is as the old version left it, a file that
// belonged to root included, and a snapshot that fails leaves the data
// untouched.
TEST_F(BtrfsDataTest, RunningPackagesDataIsCopiedBeforeItsOwnersChange) {
  ASSERT_NO_FATAL_FAILURE(RunWithAFileOfRoots());
  const std::string v1_data = Fingerprint();

  TestPackage broken = v2_;
  broken.scripts = {{"postupgrade", std::string(kRewriteTestData) + "exit 1\n"}};
  EXPECT_NE(0, Install(broken)) << out_;
  ExpectSaid("The upgrade to 2.0 failed in postupgrade; 1.0 and its data were restored.");
  EXPECT_EQ("test-app 1.0 running\n", Status());
  ExpectVersion("1", v1_data);

  // No snapshot can be made in an immutable folder.
  const std::string snapshots = root_.Path("/volume1/@appdata/.snapshots");
  std::string out;
  ASSERT_EQ(0, KIVOFSMkdirP(snapshots.c_str()));
  ASSERT_EQ(0, RunProgram({"chattr", "+i", snapshots}, &out)) << out;
  const int refused = Install(v2_);
  ASSERT_EQ(0, RunProgram({"chattr", "-i", snapshots}, &out)) << out;
  EXPECT_NE(0, refused) << out_;
  ExpectSaid("could not be copied before the upgrade");
  ExpectSaid("Nothing was changed; 1.0 runs again.");
  EXPECT_EQ("test-app 1.0 running\n", Status());
  ExpectVersion("1", v1_data);
  ExpectNothingLeftBut(0);
}

// Killed once the snapshot beside the settling of the account is taken
// and the settling gave a file of root's to the package: the next
// operation puts 1.0 back with its data as it was when it stopped, and a
// start runs it again.
TEST_F(BtrfsDataTest, RunningPackageKilledAfterItsSnapshotGetsItsDataBack) {
  ASSERT_NO_FATAL_FAILURE(RunWithAFileOfRoots());
  const std::string v1_data = Fingerprint();
  TestPackage v3 = v2_;
  v3.version = "3.0";
  EXPECT_EQ(128 + 9,
            Kivoctl({"install", v3.Build(dir_)}, &out_, {{"KIVO_PKGTOOL_FAULT", "snapshot_taken"}}))
      << out_;
  struct stat st;
  ASSERT_EQ(0, lstat((data_ + "/left-by-root").c_str(), &st));
  EXPECT_NE(0u, st.st_uid) << "the settling had not changed the data yet";
  ASSERT_EQ(0, InstallAnother()) << out_;
  ExpectVersion("1", v1_data);
  ExpectNothingLeftBut(0);
  ASSERT_EQ(0, Tool("start")) << out_;
  EXPECT_EQ("test-app 1.0 running\n", Status());
}

// kill -9 at each step of a failed upgrade's snapshot and restore: the
// package is 1.0 or 2.1 with that version's data, and the next operation
// finishes the restore and removes what is left. The package does not run,
// so its snapshot is taken while the new version is unpacked: "staged" and
// "extracted" kill the tool while it may be under way or done.
class BtrfsCrashTest : public BtrfsDataTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(BtrfsCrashTest, FailedUpgrade) {
  const std::string step = GetParam();
  ASSERT_EQ(0, Install(v1_)) << out_;
  const std::string v1_data = Fingerprint();
  TestPackage broken = v2_;
  broken.version = "2.1";
  broken.scripts = {{"postupgrade", std::string(kRewriteTestData) + "exit 1\n"}};
  EXPECT_EQ(128 + 9,
            Kivoctl({"install", broken.Build(dir_)}, &out_, {{"KIVO_PKGTOOL_FAULT", step}}))
      << out_;
  const std::string code = Code();
  if (step == "restore_half_done") {
    EXPECT_EQ("2\n", code);
    EXPECT_FALSE(KLIBCFileExist(data_.c_str()));  // away between the restore's two renames
  } else if (code == "1\n") {
    EXPECT_EQ(v1_data, Fingerprint());
  } else {
    EXPECT_EQ("2\n", code) << step;
    EXPECT_NE(v1_data, Fingerprint());
  }
  ASSERT_EQ(0, InstallAnother()) << out_;
  ExpectVersion("1", v1_data);
  EXPECT_TRUE(PMSIsSubvolume(data_));
  ExpectNothingLeftBut(0);
  ASSERT_EQ(0, Install(v2_)) << out_;
  EXPECT_EQ("2\n", Code());
}

INSTANTIATE_TEST_SUITE_P(Steps, BtrfsCrashTest,
                         ::testing::Values("staged", "extracted", "snapshot_taken", "restore_begun",
                                           "restore_half_done", "old_published"));

}  // namespace
