// "KIVO.Core.Package.Installation" and its "Download" part
// (docs/installation.md, docs/package-server.md): the environment check,
// installs from an uploaded file or from a package server, and the tasks
// that follow them.

import type { Api, Params, Result } from './client';
import type { PackagePermissions } from './permissions';
import type { ServerEntry } from './server';

const kInstallation = 'KIVO.Core.Package.Installation';
const kDownload = 'KIVO.Core.Package.Installation.Download';

// A package's download from a package server, the install that follows it
// and an install from an uploaded file run as the appliance's task of this
// id, one per package, so any page can find it again by the package's id.
export const kDownloadTaskPrefix = '@KIVOPKG_DOWNLOAD_';

export function downloadTaskId(packageId: string): string {
  return kDownloadTaskPrefix + packageId;
}

// The download task's "data" (docs/package-server.md), as "status" answers it.
export interface TaskData {
  id?: string;
  taskid?: string;
  status?: string;
  finished?: boolean;
  installing?: boolean;
  blqinst?: boolean;
  progress?: number | string;
  size?: number;
  // A download's failure is {code, message}; a failed install from a package
  // server adds the package tool's code ("result"). A job whose process died
  // reads as failed with the API code alone and the reason in "message". A
  // failed install from a file keeps its data as it started ("installing"
  // true): its task is finished, or no longer installing in the catalogue,
  // while its status still says installing (the install's own answer says
  // why).
  // An upgrade refused because the new version would break a running
  // package (the package tool's 269) names that package's id in "deppkg".
  error?: { code?: number; message?: string; result?: number; deppkg?: string } | number;
  message?: string;
  signature?: string;
  feed?: string;
  origin?: string;
}

export function taskStatus(api: Api, taskId: string): Promise<Result<TaskData>> {
  return api.call<TaskData>(kInstallation, 'status', 1, { task_id: taskId });
}

// Cancels a download, or drops a downloaded file (an install under way
// cannot be cancelled).
export function cancelTask(api: Api, taskId: string): Promise<Result<unknown>> {
  return api.call(kInstallation, 'cancel', 1, { taskid: taskId });
}

// The environment check ("check", version 2) of a package about to be
// installed; `params` say what the package needs.
export function checkInstall<T>(api: Api, params: Params): Promise<Result<T>> {
  return api.call<T>(kInstallation, 'check', 2, params);
}

// What "install" with a name answers: a new task's id, or for a download
// already under way that task's data.
export interface Started {
  taskid?: string;
  data?: TaskData;
}

export function startedTaskId(answer: Started, packageId: string): string {
  return answer.taskid ?? answer.data?.taskid ?? downloadTaskId(packageId);
}

// The entry's own file, named to the install: a switch of origin goes to
// the very source the administrator chose, not to whichever lists the
// package too.
export function entryLink(entry: ServerEntry): { url?: string; filesize?: number } {
  return entry.link ? { url: entry.link, filesize: entry.size ?? 0 } : {};
}

// The calls below that start work on the appliance are sent so that they
// outlive the page (`keepalive`): once the user asked for it, a reload or a
// closed tab right after the click must not keep the request from the
// appliance, which then carries the work to its end in its task.
const kOutlivesPage = true;

// A plain download of a catalogue entry, for the wizard to inspect; with
// `switchOrigin` from the entry's own file.
export function startDownload(api: Api, entry: ServerEntry, switchOrigin: boolean): Promise<Result<Started>> {
  const params = { name: entry.id, is_kivo: entry.source === 'kivo', ...(switchOrigin ? entryLink(entry) : {}) };
  return api.call<Started>(kInstallation, 'install', 1, params, kOutlivesPage);
}

// What the install pages chose (ui/install-pages.tsx, installParams).
export interface InstallValues {
  volume_path: string;
  extra_values?: string;
}

// A quick install of a catalogue entry: download and install in one worker
// on the appliance, with the wizard's answers, started running. With
// `switchOrigin`, from the entry's own file and with its origin switched.
// It takes the place of the package's finished download (the file the
// wizard was shown for), which the appliance drops with its file, so the
// install after a wizard is this one request.
// What the administrator allowed the install beyond the usual rules: to
// switch the package to this source, or to upgrade without the safety copy
// of its data when the volume has no room for one.
export interface InstallAllowances {
  switchOrigin?: boolean;
  withoutDataCopy?: boolean;
}

export function quickInstall(api: Api, entry: ServerEntry, values: InstallValues, allowed: InstallAllowances): Promise<Result<Started>> {
  const { switchOrigin, withoutDataCopy } = allowed;
  const params = {
    name: entry.id,
    is_kivo: entry.source === 'kivo',
    blqinst: true,
    installrunpackage: true,
    volume_path: values.volume_path,
    customuivalues: values.extra_values,
    ...(switchOrigin ? { ...entryLink(entry), switch_origin: true } : {}),
    ...(withoutDataCopy ? { without_data_copy: true } : {}),
  };
  return api.call<Started>(kInstallation, 'install', 1, params, kOutlivesPage);
}

// What "Download" "check" says about a downloaded file.
export interface DownloadedFile {
  id: string;
  name?: string;
  version?: string;
  install_pages?: string;
  license?: string;
  permissions?: PackagePermissions;
}

export function checkDownloaded(api: Api, taskId: string): Promise<Result<DownloadedFile>> {
  return api.call<DownloadedFile>(kDownload, 'check', 1, { taskid: taskId });
}

// What "upload" says about an uploaded package file.
export interface UploadAnswer {
  id: string;
  name: string;
  version: string;
  task_id: string;
  licence?: string;
  // The file's release notes, plain text (docs/package-format.md).
  changelog?: string;
  install_pages?: string;
  codesign_error?: number;
  codesign_message?: string;
  permissions?: PackagePermissions;
  additional?: { dependent_packages?: unknown; start_dependent_services?: unknown; install_type?: unknown };
}

// Uploads a package file with the details the environment check needs.
export function uploadPackage(
  api: Api,
  file: File,
  onProgress: (sent: number, total: number) => void,
  abort: AbortSignal,
): Promise<Result<UploadAnswer>> {
  const additional = ['dependent_packages', 'start_dependent_services', 'install_type'];
  return api.upload<UploadAnswer>(kInstallation, 'upload', 1, { additional }, file, onProgress, abort);
}

export interface InstallAnswer {
  message?: string;
  worker_message?: unknown;
}

// How an uploaded file is installed: `trustUnverified`, the administrator
// confirmed a package whose signature could not be verified; what else the
// administrator allowed (InstallAllowances); `start`, that it starts once
// installed.
export interface UploadInstallOptions extends InstallAllowances {
  trustUnverified: boolean;
  start: boolean;
}

// Installs the uploaded file of upload task `taskId`.
export function installUploaded(api: Api, taskId: string, values: InstallValues, options: UploadInstallOptions): Promise<Result<InstallAnswer>> {
  const params = {
    task_id: taskId,
    ...values,
    check_codesign: options.trustUnverified ? false : undefined,
    switch_origin: options.switchOrigin ? true : undefined,
    without_data_copy: options.withoutDataCopy ? true : undefined,
    // "type" 1 starts the package once it is installed.
    type: options.start ? 1 : undefined,
  };
  return api.call<InstallAnswer>(kInstallation, 'install', 1, params, kOutlivesPage);
}

// Asks the appliance to remove an uploaded file nobody will install. It
// answers at once and removes the file in the background; an upload nobody
// comes back for is swept after a day anyway. The call is kept alive so that
// it also goes out when the page itself is left.
export function cleanUpload(api: Api, taskId: string): void {
  void api.call(kInstallation, 'clean', 1, { task_id: taskId }, true);
}
