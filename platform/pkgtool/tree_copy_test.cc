// The data folder's copy engine on real files: what a copy keeps, and what
// the survey and the copy refuse without ever reading outside the tree.

#include "pkgtool/tree_copy.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/un.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

class TreeCopyTest : public ::testing::Test {
 protected:
  void SetUp() override {
    from_ = root_.Path("/data");
    to_ = root_.Path("/copy");
    ASSERT_EQ(0, KIVOFSMkdirP(from_.c_str()));
  }
  void Write(const std::string& rel, const std::string& text, unsigned mode = 0644) {
    const std::string path = from_ + "/" + rel;
    ASSERT_EQ(0, KIVOFSMkdirP(path.substr(0, path.rfind('/')).c_str()));
    ASSERT_TRUE(KIVOWriteFileAtomic(path, text, SyncToDisk::No, mode));
  }
  struct stat Stat(const std::string& path) {
    struct stat st {};
    EXPECT_EQ(0, lstat(path.c_str(), &st)) << path;
    return st;
  }
  // The survey's refusal of the data folder as it is, "" when it accepts it.
  std::string SurveyProblem() {
    TreeSurvey survey;
    bool ok = PMSSurveyTree(from_, &survey);
    EXPECT_EQ(ok, survey.problem.empty());
    return survey.problem;
  }

  TempRoot root_;
  std::string from_, to_;
};

TEST_F(TreeCopyTest, CopyKeepsContentModesOwnersTimesLinksAndAttributes) {
  Write("db/main.db", std::string(300000, 'd'));
  Write("run.sh", "#!/bin/sh\n", 04755);
  Write("shared/setgid-dir/file", "x");
  ASSERT_EQ(0, chmod((from_ + "/shared").c_str(), 01777));
  ASSERT_EQ(0, chmod((from_ + "/shared/setgid-dir").c_str(), 02750));
  ASSERT_EQ(0, lchown((from_ + "/db/main.db").c_str(), 1234, 5678));
  ASSERT_EQ(0, symlink("db/main.db", (from_ + "/current").c_str()));
  ASSERT_EQ(0, symlink("../run.sh", (from_ + "/db/runner").c_str()));
  ASSERT_EQ(0, link((from_ + "/run.sh").c_str(), (from_ + "/db/run-again.sh").c_str()));
  ASSERT_EQ(0, setxattr((from_ + "/run.sh").c_str(), "user.origin", "v1", 2, 0));
  const struct timespec old_times[2] = {{1000000, 5}, {2000000, 7}};
  ASSERT_EQ(0, utimensat(AT_FDCWD, (from_ + "/db").c_str(), old_times, 0));
  ASSERT_EQ(0, utimensat(AT_FDCWD, (from_ + "/current").c_str(), old_times, AT_SYMLINK_NOFOLLOW));

  std::string error;
  ASSERT_EQ(TreeCopyResult::kCopied, PMSCopyTree(from_, to_, &error)) << error;

  EXPECT_EQ(std::string(300000, 'd'), FileText(to_ + "/db/main.db"));
  EXPECT_EQ(04755u, Stat(to_ + "/run.sh").st_mode & 07777);
  EXPECT_EQ(01777u, Stat(to_ + "/shared").st_mode & 07777);
  EXPECT_EQ(02750u, Stat(to_ + "/shared/setgid-dir").st_mode & 07777);
  EXPECT_EQ(1234u, Stat(to_ + "/db/main.db").st_uid);
  EXPECT_EQ(5678u, Stat(to_ + "/db/main.db").st_gid);
  char target[64] = {};
  ASSERT_GT(readlink((to_ + "/current").c_str(), target, sizeof(target) - 1), 0);
  EXPECT_STREQ("db/main.db", target);
  EXPECT_TRUE(S_ISLNK(Stat(to_ + "/db/runner").st_mode));
  EXPECT_EQ(Stat(to_ + "/run.sh").st_ino, Stat(to_ + "/db/run-again.sh").st_ino);
  char value[8] = {};
  EXPECT_EQ(2, getxattr((to_ + "/run.sh").c_str(), "user.origin", value, sizeof(value)));
  EXPECT_STREQ("v1", value);
  EXPECT_EQ(2000000, Stat(to_ + "/db").st_mtim.tv_sec);
  EXPECT_EQ(7, Stat(to_ + "/db").st_mtim.tv_nsec);
  EXPECT_EQ(2000000, Stat(to_ + "/current").st_mtim.tv_sec);
  EXPECT_EQ(Stat(from_ + "/run.sh").st_mtim.tv_nsec, Stat(to_ + "/run.sh").st_mtim.tv_nsec);
}

TEST_F(TreeCopyTest, SurveyCountsTheRoomACopyTakes) {
  Write("a", std::string(5000, 'a'));                                        // two blocks
  Write("empty", "");                                                        // one
  ASSERT_EQ(0, link((from_ + "/a").c_str(), (from_ + "/a-again").c_str()));  // none more
  ASSERT_EQ(0, symlink("a", (from_ + "/link").c_str()));                     // one
  TreeSurvey survey;
  ASSERT_TRUE(PMSSurveyTree(from_, &survey)) << survey.problem;
  EXPECT_EQ(5u * 4096, survey.bytes);  // and one for the folder itself
}

TEST_F(TreeCopyTest, FifosSocketsAndDevicesAreRefusedWithoutBeingOpened) {
  Write("ok.txt", "fine");
  ASSERT_EQ(0, mkfifo((from_ + "/queue").c_str(), 0600));
  EXPECT_EQ("queue is a fifo", SurveyProblem());
  // The copy meets it too (made after the survey) and does not hang on it.
  std::string error;
  EXPECT_EQ(TreeCopyResult::kRefused, PMSCopyTree(from_, to_, &error));
  EXPECT_EQ("queue is a fifo", error);
  ASSERT_EQ(0, unlink((from_ + "/queue").c_str()));

  int fd = socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::string path = from_ + "/app.sock";
  ASSERT_LT(path.size(), sizeof(addr.sun_path));
  strcpy(addr.sun_path, path.c_str());
  ASSERT_EQ(0, bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)));
  EXPECT_EQ("app.sock is a socket", SurveyProblem());
  close(fd);
  ASSERT_EQ(0, unlink(path.c_str()));

  ASSERT_EQ(0, mknod((from_ + "/null").c_str(), S_IFCHR | 0600, makedev(1, 3)));
  EXPECT_EQ("null is a device", SurveyProblem());
}

TEST_F(TreeCopyTest, SymlinksLeadingOutAreRefusedAndNeverFollowed) {
  // Were the link followed, the walk would block on the fifo it leads to.
  const std::string outside = root_.Path("/outside.fifo");
  ASSERT_EQ(0, mkfifo(outside.c_str(), 0600));
  ASSERT_EQ(0, KIVOFSMkdirP((from_ + "/sub").c_str()));
  ASSERT_EQ(0, symlink(outside.c_str(), (from_ + "/sub/absolute").c_str()));
  EXPECT_EQ("sub/absolute is a symlink to " + outside + ", outside the data folder",
            SurveyProblem());
  ASSERT_EQ(0, unlink((from_ + "/sub/absolute").c_str()));
  ASSERT_EQ(0, symlink("../../outside.fifo", (from_ + "/sub/climbing").c_str()));
  EXPECT_EQ("sub/climbing is a symlink to ../../outside.fifo, outside the data folder",
            SurveyProblem());
  std::string error;
  EXPECT_EQ(TreeCopyResult::kRefused, PMSCopyTree(from_, to_, &error));
  // A data folder that is itself a symlink is not walked either.
  ASSERT_EQ(0, unlink((from_ + "/sub/climbing").c_str()));
  const std::string linked = root_.Path("/linked-data");
  ASSERT_EQ(0, symlink(from_.c_str(), linked.c_str()));
  TreeSurvey survey;
  EXPECT_FALSE(PMSSurveyTree(linked, &survey));
}

TEST_F(TreeCopyTest, ReflinkProbeLeavesNothingBehind) {
  const bool shared = PMSCanReflink(from_);
  std::string out;
  RunProgram({"ls", "-A", from_}, &out);
  EXPECT_EQ("", out) << "reflinks: " << shared;
}

}  // namespace
