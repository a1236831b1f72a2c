// The module's frame: the dispatch table the host reads, the exported
// handlers, and the construction of the per-request object.

#include "package_webapi.h"
#include "webapi/api_table.h"

#define KIVO_EXPORT __attribute__((visibility("default")))

namespace KIVO_PACKAGE {

PackageWebAPI::PackageWebAPI(APIRequest* request, APIResponse* response)
    : request(request), response(response), pkgMgr() {}

namespace {

// Every exported handler: one object on this stack, one member, and the
// object destroyed on the way out (also when the member throws, in which case
// the exception goes on to the host).
template <void (PackageWebAPI::*Member)()>
void RunMember(APIRequest* request, APIResponse* response) {
  PackageWebAPI api(request, response);
  (api.*Member)();
}

}  // namespace
}  // namespace KIVO_PACKAGE

using KIVO_PACKAGE::PackageWebAPI;
using KIVO_PACKAGE::RunMember;

#define KIVO_HANDLER(name)                                    \
  KIVO_EXPORT void name(APIRequest* req, APIResponse* resp) { \
    RunMember<&PackageWebAPI::name>(req, resp);               \
  }

KIVO_HANDLER(List)
KIVO_HANDLER(Get)
KIVO_HANDLER(FeasibilityCheck)
KIVO_HANDLER(CheckEnv)
KIVO_HANDLER(ReadProgress)
KIVO_HANDLER(CancelProgress)
KIVO_HANDLER(Upload)
KIVO_HANDLER(Install)
KIVO_HANDLER(CleanTmp)
KIVO_HANDLER(DeleteTmp)
KIVO_HANDLER(CheckDownloadPkgInfo)
KIVO_HANDLER(Uninstall)
KIVO_HANDLER(Start)
KIVO_HANDLER(Stop)
KIVO_HANDLER(ListServerPackage)
KIVO_HANDLER(CheckUpdate)
KIVO_HANDLER(GetLog)
KIVO_HANDLER(LoadFeedList)
KIVO_HANDLER(EditFeedList)
KIVO_HANDLER(AddFeedList)
KIVO_HANDLER(DelFeedList)
KIVO_HANDLER(AddKeyring)
KIVO_HANDLER(ListKeyring)
KIVO_HANDLER(DelKeyring)
KIVO_HANDLER(GetSetting)
KIVO_HANDLER(SetSetting)
KIVO_HANDLER(GetServerIcon)
KIVO_HANDLER(GetVXIcon)
KIVO_HANDLER(GetServerScreenshot)
KIVO_HANDLER(GetVXScreenshot)
KIVO_HANDLER(LoadConfig)
KIVO_HANDLER(SetDefVol)
KIVO_HANDLER(GetDefVol)
KIVO_HANDLER(AddAutoUpdate)
KIVO_HANDLER(DelAutoUpdate)
KIVO_HANDLER(GetFakeIFrame)

namespace {

constexpr char kPkg[] = "KIVO.Core.Package";
constexpr char kInstallation[] = "KIVO.Core.Package.Installation";
constexpr char kFeed[] = "KIVO.Core.Package.Feed";
constexpr char kKeyring[] = "KIVO.Core.Package.Feed.Keyring";
constexpr char kSetting[] = "KIVO.Core.Package.Setting";

// The order of the rows is part of the interface; keep it.
const WEBAPI_TABLE_ROW gTable[] = {
    {kPkg, 1, "list", List},
    {kPkg, 1, "get", Get},
    {kPkg, 1, "feasibility_check", FeasibilityCheck},
    {kInstallation, 1, "check", CheckEnv},
    {kInstallation, 2, "check", CheckEnv},
    {kInstallation, 1, "status", ReadProgress},
    {kInstallation, 1, "cancel", CancelProgress},
    {kInstallation, 1, "upload", Upload},
    {kInstallation, 1, "install", Install},
    {kInstallation, 1, "clean", CleanTmp},
    {"KIVO.Core.Package.Installation.Download", 1, "check", CheckDownloadPkgInfo},
    {"KIVO.Core.Package.Uninstallation", 1, "uninstall", Uninstall},
    {"KIVO.Core.Package.Control", 1, "start", Start},
    {"KIVO.Core.Package.Control", 1, "stop", Stop},
    {"KIVO.Core.Package.Server", 1, "list", ListServerPackage},
    {"KIVO.Core.Package.Server", 1, "check", CheckUpdate},
    {kInstallation, 1, "delete", DeleteTmp},
    {"KIVO.Core.Package.Log", 1, "get", GetLog},
    {kFeed, 1, "list", LoadFeedList},
    {kFeed, 1, "set", EditFeedList},
    {kFeed, 1, "add", AddFeedList},
    {kFeed, 1, "delete", DelFeedList},
    {kKeyring, 1, "add", AddKeyring},
    {kKeyring, 1, "list", ListKeyring},
    {kKeyring, 1, "delete", DelKeyring},
    {kSetting, 1, "get", GetSetting},
    {kSetting, 1, "set", SetSetting},
    {"KIVO.Core.Package.Thumb.Server", 1, "get", GetServerIcon},
    {"KIVO.Core.Package.Thumb", 1, "get", GetVXIcon},
    {"KIVO.Core.Package.Screenshot.Server", 1, "get", GetServerScreenshot},
    {"KIVO.Core.Package.Screenshot", 1, "get", GetVXScreenshot},
    {"KIVO.Core.Package.Info", 1, "get", LoadConfig},
    {"KIVO.Core.Package.Setting.Volume", 1, "set", SetDefVol},
    {"KIVO.Core.Package.Setting.Volume", 1, "get", GetDefVol},
    {"KIVO.Core.Package.Setting.Update", 1, "add", AddAutoUpdate},
    {"KIVO.Core.Package.Setting.Update", 1, "delete", DelAutoUpdate},
    {"KIVO.Core.Package.FakeIFrame", 1, "get", GetFakeIFrame},
    {"KIVO.Package", 1, "list", List},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

extern "C" KIVO_EXPORT const WEBAPI_TABLE_ROW* GetAPITable() { return gTable; }
