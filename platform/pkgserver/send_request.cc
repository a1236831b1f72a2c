#include "pkgserver/send_request.h"

#include <syslog.h>

#include "pkgserver/server_config.h"
#include "pkgserver/server_net.h"

namespace KIVOPackageTool {

namespace {

constexpr uint64_t kMaxAnswerBytes = 1 << 20;

}  // namespace

bool PMSDownloadSendRequest(const std::string& url, bool post, std::string& body,
                            PKLIBSZHASH params) {
  std::string form;
  if (params) {
    for (const auto& [key, value] : params->entries)
      form += (form.empty() ? "" : "&") + PMSUrlEncode(key) + "=" + PMSUrlEncode(value);
  }
  if (!PMSIsServerUrl(url)) {
    syslog(LOG_ERR, "%s:%d %s: not an http or https address", "send_request", __LINE__,
           url.c_str());
    return false;
  }
  HttpFetch fetch;
  if (post) {
    fetch.url = url;
    fetch.form = form.empty() ? "=" : form;
  } else {
    fetch.url = form.empty() ? url : url + (url.find('?') == std::string::npos ? "?" : "&") + form;
  }
  if (!PMSServerFetch(PMSLoadServerConfig().SmallLimits(kMaxAnswerBytes), fetch) ||
      fetch.status != 200) {
    syslog(LOG_ERR, "%s:%d %s: %s", "send_request", __LINE__, url.c_str(),
           fetch.error.empty() ? ("HTTP " + std::to_string(fetch.status)).c_str()
                               : fetch.error.c_str());
    return false;
  }
  body = std::move(fetch.body);
  return true;
}

}  // namespace KIVOPackageTool
