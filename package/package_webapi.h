// PackageWebAPI: the per-request handler object of the package center's web
// API. The host calls one exported handler per request (main.cc); the handler
// builds one PackageWebAPI on its stack, calls the member of the same role and
// destroys the object. Members answer exactly once through `response`.
#pragma once

#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "pkgtool/package_manager.h"
#include "taskmgr/task.h"
#include "webapi/api_request.h"
#include "webapi/api_response.h"

namespace KIVO_PACKAGE {

class PackageTasks;

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
  // Feeds (feed.cc): the parsed "list" parameter (answers 4501 when it is
  // not JSON), and a "set" change applied to the list (answers 4591 when the
  // new address is another feed's).
  bool ReadFeedRequest(Json::Value* parsed);
  bool ApplyFeedChange(Json::Value* feeds, const Json::Value& change);

  // Rendering (package_info.cc): the live status and web address of an
  // installed package, its uninstall wizard pages, a package file.
  void DumpStatusInfo(const PackageInfo& info, uint64_t mask, Json::Value& additional);
  void DumpUninstallPages(const PackageInfo& info, uint64_t mask, Json::Value& additional);
  void DumpPkgInfo(const std::string& path, const PackageInfo& info, Json::Value& out);

  // List and get (list.cc).
  struct AutoUpdateState {
    bool all = false;
    Json::Value list{Json::arrayValue};
  };
  AutoUpdateState ReadAutoUpdateState(uint64_t mask);
  void RenderInstalled(const PackageInfo& info, uint64_t mask, const AutoUpdateState& autoupdate,
                       Json::Value& out);
  bool IsBrickCached(const std::string& target, std::map<std::string, bool>& cache);

  // Installation (install.cc, environment.cc, misc.cc).
  bool CheckPackageFileInfo(const char* path, PackageInfo& info);
  bool CheckPackageFileInfo(const char* path, PackageInfo& info, bool strictCodesign,
                            Json::Value& result);
  // The error details of a failed package-file check (null when the code
  // has none).
  Json::Value CheckErrorDetails(int code, const PackageInfo& info, const Json::Value& details);
  // Reads the record of the package file at `path` into `info`. True when
  // it was read with a valid package id, also when only a code-signature
  // outcome stood in the way (the check decides on it); otherwise false with
  // the answer set.
  bool ReadPackageFile(const std::string& path, PackageInfo& info, bool wizard);
  bool UploadAndDescribe(const std::string& file, Json::Value& result);
  bool RegisterUpload(const std::string& file, const std::string& id, Json::Value& result);
  NVX::Task* ClaimInstallTask(NVX::TaskMgr& mgr, const PackageInfo& info);
  void RecordFailure(NVX::Task& task);
  bool InstallPackageFile(const char* path);
  // What the administrator allowed an install or a download's install
  // (pkgtool/package_origin.h): "switch_origin" (bool, default false)
  // switches the package to the origin of this file or download;
  // "without_data_copy" (bool, default false) lets an upgrade go on when
  // there is no room for the safety copy of the package's data.
  PMSInstallChoices InstallChoicesParam() const;
  bool VolumeListGet(Json::Value& out);
  bool TinboxSpaceOk(const std::string& install_type);
  bool CheckEnvConflicts(PackageManager& manager, const std::string& id, const std::string& version,
                         const std::string& conflicts, Json::Value& result);
  bool CheckEnvServices(PackageManager& manager, const std::string& depsers, int version,
                        Json::Value& result);
  bool CheckEnvDependencies(PackageManager& manager, const std::string& deppkgs,
                            Json::Value& result);
  bool CheckEnvDependents(PackageManager& manager, const std::string& id, Json::Value& result);
  bool DeleteTmpFile(const char* path);

  // Download and install from a package server (download.cc), and the
  // catalogue (server.cc).
  struct DownloadRequest {
    std::string name, link, checksum, volume, wizard_values;
    uint64_t size = 0;
    bool quick_install = false, install_and_run = false, type_flag = false;
    PMSInstallChoices choices;
  };
  void Download();
  bool DeterminePackageInfo(DownloadRequest& d) const;
  bool DownloadAndInstallPackage(const DownloadRequest& d, Json::Value& result);
  pid_t ForkProcess(NVX::Task* task, Json::Value& result, const std::string& name, uint64_t size,
                    const std::string& link, const std::string& folder, bool quickInstall,
                    const PMSInstallChoices& choices);
  // The progress a download task reports: 1.0 only once its file is there,
  // never below 0.
  static double DownloadTaskProgress(NVX::Task& task, const Json::Value& data);
  // A catalogue entry's overlay: the state of installed package `p`, and
  // the package's download.
  void AnnotateInstalled(const PackageTasks& tasks, const PackageInfo& p, Json::Value& entry);
  void AnnotateDownload(const PackageTasks& tasks, Json::Value& entry);

  // Settings (setting.cc).
  // Stores the default volume; false with the error answered (4504 for a
  // full volume, 4502 otherwise). `result` is left untouched.
  bool SavePackageDefVolPath(std::string path, Json::Value& result);
  void SetAutoUpdate(bool add);
  // False on the package center's first visit, which it records.
  bool VisitedBefore();
  void FillTermsOfService(Json::Value& reply);

  // Images (image.cc). DumpImage sends the file at `path` with a cache
  // time of `max_age` seconds and ends the process; it returns false only
  // when the file cannot be read. GetVXImage writes the found image's path
  // into `buffer`; GetServerImage gives the path of the image the request's
  // `link` names, cached or fetched (server_image.h).
  bool DumpImage(const char* path, int max_age);
  bool GetVXImage(const std::vector<int>& kinds, const char* file, char* buffer, size_t size);
  bool GetServerImage(std::string* path);
  // The screenshot file name the request asks for; false with 4500 answered
  // when the name, version or number is missing or out of range.
  bool ReadScreenshotRequest(std::string& file);

  // Start and stop (control.cc).
  void StartStop(bool start);
  bool ServiceControl(const std::string& name, bool start, Json::Value& result);

  APIRequest* request;
  APIResponse* response;
  PackageManager pkgMgr;
};

}  // namespace KIVO_PACKAGE
