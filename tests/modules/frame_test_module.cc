// A module used only by the host's tests: each row breaks one rule of the
// frame (no answer, an exception, a forked child that returns, raw output),
// so the tests can see how the host copes; two rows hold a process (a stuck
// handler, a long-lived worker) for the tests of the request server.

#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <string>
#include <unistd.h>

#include "webapi/api_request.h"
#include "webapi/api_response.h"
#include "webapi/api_table.h"

namespace {

void Silent(APIRequest*, APIResponse*) {}

void Throws(APIRequest* request, APIResponse*) {
  // Converting an object to int makes jsoncpp throw.
  (void)request->GetParam("obj", Json::Value(Json::objectValue)).asInt();
}

void ForkReturns(APIRequest*, APIResponse* response) {
  pid_t child = fork();
  Json::Value data(Json::objectValue);
  data["who"] = child == 0 ? "child" : "parent";
  response->SetSuccess(data);
  if (child > 0) usleep(200000);  // Let the child reach the host first.
}

void Raw(APIRequest*, APIResponse* response) {
  response->SetEnableOutput(false);
  fputs("Content-Type: text/plain\r\n\r\nraw body", stdout);
}

// Raw output with a status of its own, as the image methods answer a miss.
void RawStatus(APIRequest*, APIResponse* response) {
  response->SetEnableOutput(false);
  fputs("Status: 404 Not Found\r\nContent-Type: text/plain\r\n\r\nno such page", stdout);
}

// "<root>/tmp/<name>": where the process rows below leave their pid and wait
// for their release, so a test can find, kill or free them.
std::string RootTmp(const char* name) {
  const char* root = getenv("KIVO_ROOT");
  return std::string(root ? root : "") + "/tmp/" + name;
}

void WritePid(const char* name) {
  std::string tmp = RootTmp(name) + ".part";
  if (FILE* f = fopen(tmp.c_str(), "w")) {
    fprintf(f, "%d", static_cast<int>(getpid()));
    fclose(f);
    rename(tmp.c_str(), RootTmp(name).c_str());
  }
}

// Waits (at most 20 s) until "<root>/tmp/release" exists.
void AwaitRelease() {
  for (int i = 0; i < 400 && access(RootTmp("release").c_str(), F_OK) != 0; ++i) usleep(50000);
}

// A request that takes as long as the test wants (a stuck handler).
void Block(APIRequest*, APIResponse* response) {
  WritePid("block.pid");
  AwaitRelease();
  response->SetSuccess(Json::Value(Json::objectValue));
}

// A handler that starts a long-lived worker, detached as workers must be,
// and answers at once.
void Worker(APIRequest*, APIResponse* response) {
  pid_t child = fork();
  if (child == 0) {
    setsid();
    int devnull = open("/dev/null", O_RDWR);
    for (int fd = 0; fd < 3; ++fd) dup2(devnull, fd);
    WritePid("worker.pid");
    AwaitRelease();
    WritePid("worker.done");
    _exit(0);
  }
  Json::Value data(Json::objectValue);
  data["started"] = child > 0;
  response->SetSuccess(data);
}

bool RefuseAll(APIRequest*, APIResponse* response) {
  response->SetError(120, Json::Value("refused"));
  return false;
}

const WEBAPI_TABLE_ROW gTable[] = {
    {"Test.Frame", 1, "silent", Silent},    {"Test.Frame", 1, "throws", Throws},
    {"Test.Frame", 1, "fork", ForkReturns}, {"Test.Frame", 1, "raw", Raw},
    {"Test.Frame", 1, "refused", Silent},   {"Test.Frame", 1, "block", Block},
    {"Test.Frame", 1, "worker", Worker},    {"Test.Frame", 1, "raw_status", RawStatus},
    {nullptr, 0, nullptr, nullptr},
};

const WEBAPI_CHECK_ROW gCheckTable[] = {
    {"Test.Frame", 1, "refused", RefuseAll, nullptr, nullptr},
    {nullptr, 0, nullptr, nullptr, nullptr, nullptr},
};

}  // namespace

extern "C" const WEBAPI_TABLE_ROW* GetAPITable() { return gTable; }
extern "C" const WEBAPI_CHECK_ROW* GetAPICheckTable() { return gCheckTable; }
