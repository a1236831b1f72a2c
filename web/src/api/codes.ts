// The web API's result codes, one name each. Every code's words for the user are in messages.ts.

export const HostCode = {
  Unknown: 100,
  BadRequest: 101,
  UnknownApi: 102,
  UnknownMethod: 103,
  UnsupportedVersion: 104,
  NotPermitted: 105,
  SessionExpired: 106,
  NotSignedIn: 119,
  Parameter: 120,
  WrongPassword: 400,
  SignInThrottled: 407,
} as const;

// The package module's codes (docs/error-codes.md), named as in
// package/error_codes.h without the kErr prefix.
export const PackageCode = {
  UploadNotStored: 108,
  BadParameter: 4500,
  Failed: 4501,
  NoVolume: 4502,
  NoTmpDir: 4503,
  NoRoomOnVolume: 4504,
  VolumeUnusable: 4505,
  InstallRunning: 4506,
  NoSpace: 4520,
  NotPackageFile: 4521,
  BadPackageFile: 4522,
  Conflict: 4524,
  ServiceNotRunning: 4525,
  DependencyMissing: 4526,
  PortInUse: 4527,
  NotSupported: 4528,
  UnsafeMember: 4529,
  Busy: 4530,
  NoSignature: 4531,
  BadSignature: 4532,
  UnknownSigner: 4533,
  ExpiredKey: 4534,
  RevokedKey: 4535,
  OsTooNew: 4537,
  OsTooOld: 4538,
  ExtractFailed: 4540,
  UnsafePayload: 4541,
  UpgradeRolledBack: 4542,
  OtherOrigin: 4543,
  BadWizardValues: 4544,
  InstallNotInstalled: 4545,
  NotNewer: 4546,
  InstallDependency: 4547,
  VersionLimit: 4548,
  ScriptFailed: 4549,
  Cancelled: 4550,
  DependentsRunning: 4552,
  NoRoomForDataCopy: 4553,
  DataNotCopyable: 4554,
  NotFeasible: 4556,
  UninstallFailed: 4560,
  UninstallBadValues: 4561,
  UninstallDependents: 4562,
  StartFailed: 4580,
  StopFailed: 4581,
  StopDependents: 4582,
  StartVersionLimit: 4583,
  StartDependency: 4584,
  ImageNotFound: 4586,
  FeedNotServer: 4590,
  FeedExists: 4591,
  KeyUnreadable: 4592,
  KeyNotPublic: 4593,
  KeySecret: 4594,
  KeyringUnwritable: 4595,
  // Kept versions and rollback (host/revision_api.h).
  NoRevision: 4610,
  RevisionBusy: 4611,
  RollbackFailed: 4612,
  DropFailed: 4613,
  RevisionNotInstalled: 4614,
  // Memory and process limits, and what packages use (host/usage_api.h).
  LimitAboveBound: 4615,
  UsageNotInstalled: 4616,
  RootNotTrusted: 4620,
  // The package's own account (docs/package-tool.md, "Accounts and confinement").
  NoAccountId: 4645,
  AccountFiles: 4646,
  // The window and holds of automatic updates (host/auto_update_api.h).
  HoldNotInstalled: 4630,
  AutoUpdateNotStored: 4631,
  HoldsUnreadable: 4632,
} as const;

// The package tool's result codes that the page acts on (docs/package-tool.md):
// a failed install from a package server carries one in its task's
// "error"."result".
export const ToolCode = {
  // Running packages need a version this one is not (an upgrade).
  DependentsRunning: 269,
  // An upgrade failed and the version before it was put back with its data.
  UpgradeRolledBack: 305,
  OtherOrigin: 306,
  // The volume has no room for the safety copy of the data an upgrade takes.
  NoRoomForDataCopy: 307,
} as const;

// The "code" of the "error" a failed download or install leaves in its task
// (platform/pkgserver/download.h): the download worker's own, not the API's.
export const DownloadCode = {
  Network: 1,
  Http: 2,
  TooLarge: 3,
  Checksum: 4,
  Disk: 5,
  Install: 6,
  Request: 7,
} as const;
