// The names of every web API the appliance serves: the host's own and those
// of the package center's module. The module's tables register its names
// with the host; the host answers its own, and treats a few of the module's
// apart (the methods browsers load by URL, the page that guards itself).
#pragma once

namespace WebAPIName {

// Served by the host.
inline constexpr char kInfo[] = "KIVO.API.Info";
inline constexpr char kAuth[] = "KIVO.API.Auth";
inline constexpr char kUserSettings[] = "KIVO.API.UserSettings";
// The activity log, beside the module's APIs (host/activity_api.h).
inline constexpr char kActivity[] = "KIVO.Core.Package.Activity";
// The maintenance window, holds and last run of automatic updates
// (host/auto_update_api.h).
inline constexpr char kAutoUpdate[] = "KIVO.Core.Package.AutoUpdate";
// Kept earlier versions and rollback, beside the module's APIs
// (host/revision_api.h).
inline constexpr char kRevision[] = "KIVO.Core.Package.Revision";
// How fresh the catalogue is, per source (host/sources_api.h).
inline constexpr char kSources[] = "KIVO.Core.Package.Sources";
// What the watchdog did to each package (host/watchdog_api.h).
inline constexpr char kWatchdog[] = "KIVO.Core.Package.Watchdog";
// What each package uses now, from its control group (host/usage_api.h).
inline constexpr char kUsage[] = "KIVO.Core.Package.Usage";

// Served by the package center's module.
inline constexpr char kPackage[] = "KIVO.Core.Package";
inline constexpr char kInstallation[] = "KIVO.Core.Package.Installation";
inline constexpr char kDownload[] = "KIVO.Core.Package.Installation.Download";
inline constexpr char kUninstallation[] = "KIVO.Core.Package.Uninstallation";
inline constexpr char kControl[] = "KIVO.Core.Package.Control";
inline constexpr char kServer[] = "KIVO.Core.Package.Server";
inline constexpr char kLog[] = "KIVO.Core.Package.Log";
inline constexpr char kFeed[] = "KIVO.Core.Package.Feed";
inline constexpr char kKeyring[] = "KIVO.Core.Package.Feed.Keyring";
inline constexpr char kSetting[] = "KIVO.Core.Package.Setting";
inline constexpr char kVolumeSetting[] = "KIVO.Core.Package.Setting.Volume";
inline constexpr char kUpdateSetting[] = "KIVO.Core.Package.Setting.Update";
inline constexpr char kPackageInfo[] = "KIVO.Core.Package.Info";
inline constexpr char kThumb[] = "KIVO.Core.Package.Thumb";
inline constexpr char kServerThumb[] = "KIVO.Core.Package.Thumb.Server";
inline constexpr char kScreenshot[] = "KIVO.Core.Package.Screenshot";
inline constexpr char kServerScreenshot[] = "KIVO.Core.Package.Screenshot.Server";
inline constexpr char kFakeIFrame[] = "KIVO.Core.Package.FakeIFrame";
// The list's name from before the package center had APIs of its own; it
// answers "list" without a parameter checker.
inline constexpr char kLegacyPackage[] = "KIVO.Package";

}  // namespace WebAPIName
