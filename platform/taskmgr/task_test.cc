#include "taskmgr/task.h"

#include <memory>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "testing/temp_root.h"

namespace {

class TaskTest : public ::testing::Test {
 protected:
  TempRoot root_;
  NVX::TaskMgr mgr_{"@administrators"};
};

TEST_F(TaskTest, PropertiesFinishAndRemove) {
  std::unique_ptr<NVX::Task> task(GetNewTask("@administrators", "@KIVOPKG_UPLOAD_1"));
  ASSERT_TRUE(task);
  EXPECT_TRUE(task->getProperty("data").isNull());
  EXPECT_EQ(0.0, task->getDoubleProperty("progress", 0.0));
  Json::Value data(Json::objectValue);
  data["id"] = "demo";
  data["pid"] = 42;
  ASSERT_TRUE(task->setProperty("data", data));
  ASSERT_TRUE(task->setProperty("progress", 0.5));
  EXPECT_EQ(data, task->getProperty("data"));
  EXPECT_EQ(0.5, task->getDoubleProperty("progress", 0.0));
  EXPECT_FALSE(task->isFinished());
  ASSERT_TRUE(task->finish(false));
  EXPECT_TRUE(task->isFinished());
  ASSERT_TRUE(task->setFinishValue(false));
  EXPECT_FALSE(task->isFinished());

  std::unique_ptr<NVX::Task> again(GetTaskWithTaskMgr(mgr_, "@KIVOPKG_UPLOAD_1"));
  ASSERT_TRUE(again);
  EXPECT_EQ("demo", again->getProperty("data")["id"].asString());
  EXPECT_EQ((std::vector<std::string>{"@KIVOPKG_UPLOAD_1"}), mgr_.listTasks("@KIVOPKG_UPLOAD_"));
  ASSERT_TRUE(again->remove());
  EXPECT_FALSE(mgr_.hasTask("@KIVOPKG_UPLOAD_1"));
  EXPECT_EQ(nullptr, GetTaskWithTaskMgr(mgr_, "@KIVOPKG_UPLOAD_1"));
  // Another owner's task of the same id is another task.
  std::unique_ptr<NVX::Task> other(GetNewTask("@someone", "@KIVOPKG_UPLOAD_1"));
  EXPECT_FALSE(mgr_.hasTask("@KIVOPKG_UPLOAD_1"));
}

TEST_F(TaskTest, UpdatesAreAllOrNothingAndRecreatingStartsAfresh) {
  std::unique_ptr<NVX::Task> task(GetNewTask("@administrators", "t"));
  ASSERT_TRUE(task->setProperty("progress", 0.7));
  task->beginUpdate();
  ASSERT_TRUE(task->setProperty("data", Json::Value("new")));
  ASSERT_TRUE(task->unsetProperty("progress"));
  EXPECT_TRUE(task->getProperty("data").isNull());  // not written before endUpdate
  ASSERT_TRUE(task->endUpdate());
  EXPECT_EQ("new", task->getProperty("data").asString());
  EXPECT_TRUE(task->getProperty("progress").isNull());
  std::unique_ptr<NVX::Task> fresh(GetNewTask("@administrators", "t"));
  EXPECT_TRUE(fresh->getProperty("data").isNull());
}

// Writers in forked processes (each with its own connection) and a reader
// waiting for data.
TEST_F(TaskTest, ProcessesShareTasks) {
  std::unique_ptr<NVX::Task> task(GetNewTask("@administrators", "shared"));
  task->getProperty("warm-up");  // this process has a connection open across the fork
  std::vector<pid_t> children;
  for (int c = 0; c < 4; ++c) {
    pid_t pid = fork();
    if (pid == 0) {
      for (int i = 0; i < 20; ++i) {
        if (!task->setProperty("k" + std::to_string(c) + "_" + std::to_string(i), i)) _exit(1);
      }
      if (c == 3 && !task->setProperty("data", Json::Value("ready"))) _exit(1);
      _exit(0);
    }
    children.push_back(pid);
  }
  EXPECT_TRUE(task->waitForDataReady("data", 30));
  for (pid_t pid : children) {
    int status;
    waitpid(pid, &status, 0);
    EXPECT_EQ(0, WEXITSTATUS(status));
  }
  for (int c = 0; c < 4; ++c) {
    for (int i = 0; i < 20; ++i) {
      EXPECT_EQ(i, task->getProperty("k" + std::to_string(c) + "_" + std::to_string(i)).asInt());
    }
  }
  EXPECT_FALSE(task->waitForDataReady("never", 1));
}

bool HeldByLivingPid(const Json::Value& data) {
  return data["pid"].isInt() && kill(data["pid"].asInt(), 0) == 0;
}

Json::Value JobOf(pid_t pid) {
  Json::Value data(Json::objectValue);
  data["pid"] = static_cast<int>(pid);
  return data;
}

// Claims by several processes at once: one wins, the others leave its task
// as it is; a finished task or one whose job is gone is claimed anew.
TEST_F(TaskTest, ClaimsAreExclusive) {
  std::vector<pid_t> children;
  for (int c = 0; c < 4; ++c) {
    pid_t pid = fork();
    if (pid == 0) {
      NVX::Task* raw = nullptr;
      auto claim =
          NVX::TaskMgr("@administrators").claimTask("job", JobOf(getppid()), HeldByLivingPid, &raw);
      delete raw;
      _exit(claim == NVX::TaskMgr::Claim::kClaimed ? 0
            : claim == NVX::TaskMgr::Claim::kBusy  ? 2
                                                   : 1);
    }
    children.push_back(pid);
  }
  int claimed = 0, busy = 0;
  for (pid_t pid : children) {
    int status;
    waitpid(pid, &status, 0);
    claimed += WEXITSTATUS(status) == 0;
    busy += WEXITSTATUS(status) == 2;
  }
  EXPECT_EQ(1, claimed);
  EXPECT_EQ(3, busy);
  NVX::Task* raw = nullptr;
  EXPECT_EQ(NVX::TaskMgr::Claim::kBusy, mgr_.claimTask("job", JobOf(1), HeldByLivingPid, &raw));
  std::unique_ptr<NVX::Task> held(mgr_.getTask("job"));
  EXPECT_EQ(getpid(), held->getProperty("data")["pid"].asInt());
  ASSERT_TRUE(held->finish(false));
  ASSERT_EQ(NVX::TaskMgr::Claim::kClaimed,
            mgr_.claimTask("job", JobOf(999999), HeldByLivingPid, &raw));
  std::unique_ptr<NVX::Task> again(raw);
  EXPECT_FALSE(again->isFinished());
  // Its job (pid 999999) is gone: the task is free again.
  ASSERT_EQ(NVX::TaskMgr::Claim::kClaimed,
            mgr_.claimTask("job", JobOf(getpid()), HeldByLivingPid, &raw));
  delete raw;
}

TEST(TaskUtilTest, UniqueIds) {
  std::string first, second;
  ASSERT_TRUE(NVX::TaskUtil::getUniqueID("@administrators", 0, &first));
  ASSERT_TRUE(NVX::TaskUtil::getUniqueID("@administrators", 0, &second));
  EXPECT_NE(first, second);
}

}  // namespace
