#include "testing/admin_api_test.h"

#include <unistd.h>

#include <json/writer.h>

AdminApiTest::AdminApiTest() { root_.AddAccount("admin", "secret", {"administrators"}); }

const ApiClient& AdminApiTest::client() {
  std::call_once(signed_in_, [this] { client_ = std::make_unique<ApiClient>("admin", "secret"); });
  return *client_;
}

void AdminApiTest::Trust(int level) const {
  root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"" + std::to_string(level) + "\"\n");
}

CgiAnswer WaitTaskFinished(const ApiClient& client, const std::string& task_id, int tries) {
  CgiAnswer s;
  for (int i = 0; i < tries; ++i) {
    s = client.Call("KIVO.Core.Package.Installation", "status", 1, {{"task_id", task_id}});
    if (s.Data()["finished"].asBool()) break;
    usleep(50000);
  }
  return s;
}

Json::Value CatalogueEntry(const CgiAnswer& list, const std::string& id) {
  for (const Json::Value& e : list.Data()["data"]) {
    if (e["id"].asString() == id) return e;
  }
  return Json::Value();
}

std::string ListParam(const Json::Value& value) {
  Json::StreamWriterBuilder b;
  b["indentation"] = "";
  return Json::writeString(b, Json::Value(Json::writeString(b, value)));
}
