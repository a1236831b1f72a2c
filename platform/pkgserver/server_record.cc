#include "pkgserver/server_record.h"

#include "pkgserver/catalogue.h"
#include "pkgserver/server_config.h"

namespace KIVOPackageServer {

bool GetPackageInfoFromServer(const std::string& name, Json::Value& record, bool isKivo,
                              const std::string& language) {
  Json::Value entry;
  if (!PMSFindServerEntry(name, isKivo, language, entry)) return false;
  if (!entry["link"].isString() || !PMSIsServerUrl(entry["link"].asString())) return false;
  record = Json::Value(Json::objectValue);
  record["package"] = name;
  record["link"] = entry["link"];
  if (entry["version"].isString()) record["version"] = entry["version"];
  if (entry["md5"].isString()) record["md5"] = entry["md5"];
  if (entry["sha256"].isString()) record["sha256"] = entry["sha256"];
  if (entry["size"].isUInt64()) record["size"] = entry["size"];
  if (entry["type"].isInt()) record["type"] = entry["type"];
  return true;
}

bool PMSGetPkgFromServer(const std::string& language, PackageInfo& info) {
  Json::Value record;
  if (!GetPackageInfoFromServer(info.getId(), record, true, language)) return false;
  info.set("link", record["link"].asString());
  info.set("checksum", record["md5"].asString());
  info.set("size", std::to_string(record["size"].asUInt64()));
  info.set("type", std::to_string(record["type"].asInt()));
  return true;
}

}  // namespace KIVOPackageServer
