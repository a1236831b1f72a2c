// A small request to a vendor endpoint (such as the company-information
// endpoint of pkgserver.conf's company_info_url).
#pragma once

#include <string>

#include "klibc/string_list.h"

namespace KIVOPackageTool {

// Sends `params` to `url`: urlencoded in a POST body when `post`, else in
// the query string. `body` gets the answer (at most 1 MiB). True when the
// server answered 200.
bool PMSDownloadSendRequest(const std::string& url, bool post, std::string& body,
                            PKLIBSZHASH params);

}  // namespace KIVOPackageTool
