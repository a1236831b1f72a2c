// The module's frame: the exported handlers, the table of the methods it
// serves with their checkers (from which the host's dispatch and check
// tables are made), and the construction of the per-request object.

#include <array>
#include <cstddef>

#include "package_webapi.h"
#include "param_check.h"
#include "webapi/api_names.h"
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

namespace api = WebAPIName;
using namespace KIVO_PACKAGE;

// One method the module serves: its API, version and name, its handler, and
// the parameter checker the host runs first (null: none).
struct MethodRow {
  const char* api;
  int version;
  const char* method;
  WebAPIHandler handler;
  WebAPIChecker checker;
};

// Every method. The order of the rows is part of the interface; keep it.
constexpr MethodRow kMethods[] = {
    {api::kPackage, 1, "list", List, CheckList},
    {api::kPackage, 1, "get", Get, CheckGet},
    {api::kPackage, 1, "feasibility_check", FeasibilityCheck, CheckFeasibility},
    {api::kInstallation, 1, "check", CheckEnv, CheckInstallationCheck},
    {api::kInstallation, 2, "check", CheckEnv, CheckInstallationCheck},
    {api::kInstallation, 1, "status", ReadProgress, CheckTaskId},
    {api::kInstallation, 1, "cancel", CancelProgress, CheckTaskid},
    {api::kInstallation, 1, "upload", Upload, AlwaysAccept},
    {api::kInstallation, 1, "install", Install, CheckInstall},
    {api::kInstallation, 1, "clean", CleanTmp, CheckTaskId},
    {api::kDownload, 1, "check", CheckDownloadPkgInfo, CheckTaskid},
    {api::kUninstallation, 1, "uninstall", Uninstall, CheckUninstall},
    {api::kControl, 1, "start", Start, CheckStart},
    {api::kControl, 1, "stop", Stop, CheckIds},
    {api::kServer, 1, "list", ListServerPackage, CheckServerList},
    {api::kServer, 1, "check", CheckUpdate, AlwaysAccept},
    {api::kInstallation, 1, "delete", DeleteTmp, CheckTmpPath},
    {api::kLog, 1, "get", GetLog, CheckLogName},
    {api::kFeed, 1, "list", LoadFeedList, AlwaysAccept},
    {api::kFeed, 1, "set", EditFeedList, CheckFeedList},
    {api::kFeed, 1, "add", AddFeedList, CheckFeedList},
    {api::kFeed, 1, "delete", DelFeedList, CheckFeedList},
    {api::kKeyring, 1, "add", AddKeyring, CheckKeyringAdd},
    {api::kKeyring, 1, "list", ListKeyring, AlwaysAccept},
    {api::kKeyring, 1, "delete", DelKeyring, CheckKeyringDelete},
    {api::kSetting, 1, "get", GetSetting, AlwaysAccept},
    {api::kSetting, 1, "set", SetSetting, CheckSettingSet},
    {api::kServerThumb, 1, "get", GetServerIcon, CheckThumbServer},
    {api::kThumb, 1, "get", GetVXIcon, CheckThumb},
    {api::kServerScreenshot, 1, "get", GetServerScreenshot, CheckScreenshotServer},
    {api::kScreenshot, 1, "get", GetVXScreenshot, CheckScreenshot},
    {api::kPackageInfo, 1, "get", LoadConfig, AlwaysAccept},
    {api::kVolumeSetting, 1, "set", SetDefVol, CheckVolumeSet},
    {api::kVolumeSetting, 1, "get", GetDefVol, AlwaysAccept},
    {api::kUpdateSetting, 1, "add", AddAutoUpdate, CheckIds},
    {api::kUpdateSetting, 1, "delete", DelAutoUpdate, CheckIds},
    {api::kFakeIFrame, 1, "get", GetFakeIFrame, AlwaysAccept},
    {api::kLegacyPackage, 1, "list", List, nullptr},
};
constexpr size_t kMethodCount = sizeof(kMethods) / sizeof(kMethods[0]);

// The dispatch table the host reads: every method, then the all-zero row.
constexpr std::array<WEBAPI_TABLE_ROW, kMethodCount + 1> DispatchTable() {
  std::array<WEBAPI_TABLE_ROW, kMethodCount + 1> table{};
  for (size_t i = 0; i < kMethodCount; ++i) {
    const MethodRow& m = kMethods[i];
    table[i] = WEBAPI_TABLE_ROW{m.api, m.version, m.method, m.handler};
  }
  return table;
}

// The check table the host reads: the methods with a checker, then the
// all-zero row that ends it (the rows after it, one per method without a
// checker, are zero too and never read). Not constexpr: under the
// sanitizers a function's address compared with null is no constant
// expression, so the table is made as the module loads and never changes.
std::array<WEBAPI_CHECK_ROW, kMethodCount + 1> CheckTable() {
  std::array<WEBAPI_CHECK_ROW, kMethodCount + 1> table{};
  size_t n = 0;
  for (const MethodRow& m : kMethods) {
    if (m.checker)
      table[n++] = WEBAPI_CHECK_ROW{m.api, m.version, m.method, m.checker, nullptr, nullptr};
  }
  return table;
}

constexpr auto kDispatchTable = DispatchTable();
const auto kCheckTable = CheckTable();

}  // namespace

extern "C" KIVO_EXPORT const WEBAPI_TABLE_ROW* GetAPITable() { return kDispatchTable.data(); }

extern "C" KIVO_EXPORT const WEBAPI_CHECK_ROW* GetAPICheckTable() { return kCheckTable.data(); }
