// The inline-frame page: a blank, transparent page whose script sets a flag
// the web desktop watches to learn that its embedded frame has loaded. It is a
// raw page, not a JSON answer, and only an administrator may see it; everyone
// else gets a bare 404, which does not even tell that the page exists.

#include <cstdio>

#include "package_webapi.h"
#include "webapi/web_man.h"

namespace KIVO_PACKAGE {
namespace {

// The session layer's level for a page that any signed-in caller may load.
constexpr int kAnySignedInLevel = 15;

void WritePage(WebMan* webman) {
  webman->WriteHeader("text/html; charset=\"UTF-8\"");
  // The two style lines go through a format, hence the doubled percent signs.
  printf(
      "<html style='background-color:transparent;overflow:hidden;margin:0;height:100%%;"
      "width:100%%;border-width:0;'>\n");
  printf("<head>\n");
  printf("<meta http-equiv=\"Content-Type\" content=\"text/html; charset=utf-8\">\n");
  printf("<meta http-equiv='X-UA-Compatible' content='IE=9' />\n");
  printf("</head>\n");
  printf(
      "<body style='background-color:transparent;overflow:hidden;margin:0;height:100%%;"
      "width:100%%;border-width:0;'>\n");
  printf("<script type='text/javascript'>document.blready=true;</script>\n");
  printf("</body></html>\n");
}

}  // namespace

void PackageWebAPI::GetFakeIFrame() {
  WebMan webman(true);
  response->SetEnableOutput(false);
  if (webman.IsAuthorized(nullptr, kAnySignedInLevel, CGI_POSITION_WEBAPI) && webman.LoadIn() &&
      webman.IsAdmin()) {
    WritePage(&webman);
    return;
  }
  webman.AddHeader("Cache-control", "no-store");
  webman.AddHeader("Status", "404 Not Found");
}

}  // namespace KIVO_PACKAGE
