// PackageWebAPI: the per-request handler object of the package center's web
// API. The host calls one exported handler per request (main.cc); the handler
// builds one PackageWebAPI on its stack, calls the member of the same role and
// destroys the object. Members answer exactly once through `response`.
#pragma once

#include "pkgtool/package_manager.h"
#include "webapi/api_request.h"
#include "webapi/api_response.h"

namespace KIVO_PACKAGE {

class PackageWebAPI {
 public:
  // Borrows both pointers for the duration of the call.
  PackageWebAPI(APIRequest* request, APIResponse* response);
  PackageWebAPI(const PackageWebAPI&) = delete;
  PackageWebAPI& operator=(const PackageWebAPI&) = delete;

  // Installed packages.
  void List();
  void Get();
  void GetLog();
  // Package control.
  void FeasibilityCheck();
  void Start();
  void Stop();
  void Uninstall();
  // Installation.
  void CheckEnv();
  void ReadProgress();
  void CancelProgress();
  void Upload();
  void Install();
  void CleanTmp();
  void DeleteTmp();
  // Package servers.
  void CheckDownloadPkgInfo();
  void ListServerPackage();
  void CheckUpdate();
  // Feeds and keyrings.
  void LoadFeedList();
  void EditFeedList();
  void AddFeedList();
  void DelFeedList();
  void AddKeyring();
  void ListKeyring();
  void DelKeyring();
  // Settings.
  void GetSetting();
  void SetSetting();
  void LoadConfig();
  void SetDefVol();
  void GetDefVol();
  void AddAutoUpdate();
  void DelAutoUpdate();
  // Images and pages.
  void GetServerIcon();
  void GetVXIcon();
  void GetServerScreenshot();
  void GetVXScreenshot();
  void GetFakeIFrame();

 private:
  // Answers that the member's method is not part of this build yet.
  void AnswerNotAvailable(const char* member);

  APIRequest* request;
  APIResponse* response;
  PackageManager pkgMgr;
};

}  // namespace KIVO_PACKAGE
