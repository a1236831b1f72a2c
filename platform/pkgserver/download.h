// Downloading a package file from a package server in a worker process, and
// installing it there. The worker reports through its task (taskmgr), whose
// "data" object the web desktop polls:
//
//   "id", "name"   package id            "taskid"     the task's id
//   "pid"          the worker's pid      "link"       where the file comes from
//   "size"         announced size (0: unknown)
//   "tmp_folder"   the download folder; the file is tmp_folder + "/" + taskid
//   "blqinst"      true: install right after the download (quick install)
//   "switch_origin" true: the administrator switches the package to the
//                  origin of this download (package_origin.h)
//   "installing"   true while the package tool installs the file
//   "status"       "downloading", "downloaded", "installing", "upgrading",
//                  "installed" or "failed"
//   "error"        on failure: {"code": PMSDownloadError, "message": text,
//                  and for an install "result": the package tool's code}
//   "origin", "feed", "signature"  once the file was checked: the source in
//                  words, the feed's address ("" for another source), and
//                  which key signed the file and who vouched for it
//
// and the task's number property "progress": 0 to 1 while downloading
// (written a few times a second), 1.0 once the file is complete and checked,
// -1 after a failure. A finished task was finished with ok = true only when
// the download (and a quick install) succeeded. A failed, refused or
// canceled download removes its folder.
#pragma once

#include <cstdint>
#include <string>
#include <sys/types.h>

#include "pkgtool/package_origin.h"
#include "taskmgr/task.h"

// The "code" of the "error" a failed download or install leaves in its task.
enum PMSDownloadError {
  PMS_DL_ERR_NETWORK = 1,    // server unreachable, stalled, or the connection dropped for good
  PMS_DL_ERR_HTTP = 2,       // the server answered with an error status (404, ...)
  PMS_DL_ERR_TOO_LARGE = 3,  // more bytes than the catalogue announced
  PMS_DL_ERR_CHECKSUM = 4,   // md5 or sha256 differ from the catalogue's
  PMS_DL_ERR_DISK = 5,       // the file could not be written
  PMS_DL_ERR_INSTALL = 6,    // the package tool refused or failed the install
  PMS_DL_ERR_REQUEST = 7,    // the download was described wrongly (no link, bad folder)
};

namespace KIVOPackageServer {

// True when the download task of `name` exists, is not finished and its
// worker lives.
bool IsInstalling(const std::string& name);

// The "data" above of a new download in task `taskId`, with "status"
// "downloading", before its worker has a "pid".
Json::Value NewDownloadData(const std::string& taskId, const std::string& name, uint64_t size,
                            const std::string& link, const std::string& folder, bool quickInstall,
                            const PMSInstallChoices& choices);

// Records a new download in `task`: the "data" above with "status"
// "downloading", "progress" 0, not finished, with what the administrator
// allowed the install (`choices`). False when the task cannot be written.
bool InitDownload(NVX::Task* task, const std::string& name, uint64_t size, const std::string& link,
                  const std::string& folder, bool quickInstall, pid_t pid,
                  const PMSInstallChoices& choices = PMSInstallChoices());

// In the worker: makes SIGTERM cancel the transfer under way instead of
// ending the process at once, so the worker can clean up.
void RegisterCancel();
bool isCanceled();

// In the worker: downloads `link` into folder + "/" + task id, checks the
// size the task announced, `checksum` (md5, when not empty) and the sha256
// the catalogue gives for this link, and reports in the task (see above).
// `resultPath` gets the file's path. False on failure or cancel.
bool DownloadPackage(NVX::Task* task, const std::string& user, const std::string& name,
                     const std::string& link, const std::string& checksum, bool quickInstall,
                     const std::string& folder, const std::string& language,
                     std::string& resultPath);

// In the worker, after DownloadPackage: installs the downloaded file onto
// `volume` ("" for the default) with the wizard answers `wizardValues`,
// starting it when `run`. `typeFlag` true allows reinstalling the same or a
// lower version. The file's origin is the source whose catalogue lists the
// task's link (catalogue.h, PMSListingOrigin), with that feed's keys; the
// task's "switch_origin" says whether it may replace a package of another
// origin, its "without_data_copy" whether an upgrade may go on without a
// safety copy of the data. Publishes "installing" with the package tool's progress,
// removes the download folder, and finishes the task. False on failure.
bool Install(NVX::Task* task, const std::string& user, const std::string& volume,
             const std::string& name, const std::string& folder, bool run,
             const std::string& wizardValues, bool typeFlag, const std::string& language);

// Removes a download folder made by PMSCreateDownloadTmpDir; refuses any
// other path. True when it is gone.
bool PMSRemoveDownloadDir(const std::string& folder);

}  // namespace KIVOPackageServer
