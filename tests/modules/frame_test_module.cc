// A module used only by the host's tests: each row breaks one rule of the
// frame (no answer, an exception, a forked child that returns, raw output),
// so the tests can see how the host copes.

#include <cstdio>
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

bool RefuseAll(APIRequest*, APIResponse* response) {
  response->SetError(120, Json::Value("refused"));
  return false;
}

const WEBAPI_TABLE_ROW gTable[] = {
    {"Test.Frame", 1, "silent", Silent},    {"Test.Frame", 1, "throws", Throws},
    {"Test.Frame", 1, "fork", ForkReturns}, {"Test.Frame", 1, "raw", Raw},
    {"Test.Frame", 1, "refused", Silent},   {nullptr, 0, nullptr, nullptr},
};

const WEBAPI_CHECK_ROW gCheckTable[] = {
    {"Test.Frame", 1, "refused", RefuseAll, nullptr, nullptr},
    {nullptr, 0, nullptr, nullptr, nullptr, nullptr},
};

}  // namespace

extern "C" const WEBAPI_TABLE_ROW* GetAPITable() { return gTable; }
extern "C" const WEBAPI_CHECK_ROW* GetAPICheckTable() { return gCheckTable; }
