#include "host/sources_api.h"

#include <ctime>
#include <syslog.h>

#include "pkgserver/feed_file.h"
#include "pkgserver/server_config.h"
#include "pkgserver/source_status.h"

namespace {

using KIVOPackageServer::SourceStatus;

const char* StateOf(const SourceStatus& s) {
  if (!s.known) return "unknown";
  return s.failing_since != 0 ? "failing" : "ok";
}

// One source with its record. An empty address is the vendor's when none is
// configured. A record that cannot be read tells nothing: the source is
// "unknown" then (logged), and its next fetch writes the record afresh.
Json::Value Source(const char* kind, const std::string& url, const std::string& name) {
  SourceStatus status;
  if (!url.empty() && !KIVOPackageServer::PMSReadSourceStatus(url, &status)) {
    syslog(LOG_ERR, "%s:%d cannot read the fetch record of %s", "sources_api", __LINE__,
           url.c_str());
    status = SourceStatus();
  }
  Json::Value out = KIVOPackageServer::PMSSourceStatusJson(status);
  out["kind"] = kind;
  out["url"] = url;
  out["name"] = name;
  out["state"] = url.empty() ? "unconfigured" : StateOf(status);
  return out;
}

}  // namespace

void SourcesList(const APIRequest& /*request*/, APIResponse* response) {
  Json::Value sources(Json::arrayValue);
  sources.append(Source("vendor", PMSLoadServerConfig().vendor_url, "the vendor's server"));
  for (const KIVOPackageServer::ListedFeed& feed : KIVOPackageServer::PMSListedFeeds())
    sources.append(Source("feed", feed.url, feed.name));
  Json::Value data(Json::objectValue);
  data["now"] = static_cast<Json::Int64>(time(nullptr));
  data["sources"] = sources;
  response->SetSuccess(data);
}
