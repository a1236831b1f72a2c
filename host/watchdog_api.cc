#include "host/watchdog_api.h"

#include "pkgtool/registry.h"
#include "pkgtool/watchdog_record.h"

void WatchdogList(const APIRequest& /*request*/, APIResponse* response) {
  const long long now = PMSNowMs();
  Json::Value data(Json::objectValue);
  data["packages"] = Json::Value(Json::arrayValue);
  // Read without the lock, as the module's list is: each file is replaced
  // whole, so a reader sees it before or after a change.
  for (const std::string& id : PackageRegistry::List()) {
    data["packages"].append(PMSWatchdogView(id, now));
  }
  response->SetSuccess(data);
}
