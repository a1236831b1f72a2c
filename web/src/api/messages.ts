// Words for every result code the web API can answer (the host's codes in
// docs/http-api.md, the package module's in docs/error-codes.md), written for
// an administrator: what happened and what to do. Where the answer's "errors"
// name what is in the way (packages, services, a port, versions, the package
// tool's own words), they are told too. An unknown code still shows its
// number, so a user can report it.

import { kNoAnswer, type ApiFailure } from './client';
import { HostCode, PackageCode } from './codes';
import { settingStepWords } from './setting';

type Errors = Record<string, unknown>;

// Sentences that more than one code stands for: an install and a start
// refused for the same reason read the same.
const kNeedsOthers = 'This package needs other packages that are not installed or not running.';
const kVersionMismatch = 'A package this one needs is installed in a version that does not fit. Upgrade it first.';

const messages: Record<number, string> = {
  [kNoAnswer]: 'The appliance did not answer. Check the connection and try again.',

  [HostCode.Unknown]: 'The appliance could not complete the request. Try again; if it keeps failing, check the system log.',
  [HostCode.BadRequest]: 'The appliance did not understand the request. Reload the page and try again.',
  [HostCode.UnknownApi]: 'The appliance does not offer this function. Its software may be older than this page.',
  [HostCode.UnknownMethod]: 'The appliance does not offer this function. Its software may be older than this page.',
  [HostCode.UnsupportedVersion]: 'The appliance does not offer this version of the function. Reload the page.',
  [HostCode.NotPermitted]: 'You are not allowed to do this: only administrators, signed in on this page, manage packages.',
  [HostCode.SessionExpired]: 'Your session has expired. Please sign in again.',
  [HostCode.NotSignedIn]: 'You are not signed in. Please sign in.',
  [HostCode.Parameter]: 'A value sent to the appliance was missing or not valid.',
  [HostCode.WrongPassword]: 'Wrong account or password.',
  [HostCode.SignInThrottled]: 'Too many failed sign-ins.',

  [PackageCode.UploadNotStored]: 'The file did not arrive whole. Upload it again.',
  [PackageCode.BadParameter]: 'The request named no package or held an invalid value. Reload the page and try again.',
  [PackageCode.Failed]: 'The package operation failed.',
  [PackageCode.NoVolume]: 'No usable volume with free space was found. Add or repair a volume, or free some space.',
  [PackageCode.NoTmpDir]: 'The appliance cannot make a temporary folder on its volumes. Check that a volume is usable and has room.',
  [PackageCode.NoRoomOnVolume]: 'The chosen volume has no room for this package. Choose another volume or free some space.',
  [PackageCode.VolumeUnusable]: 'The package\'s volume is missing or damaged. Repair the volume, then try again.',
  [PackageCode.InstallRunning]: 'The install could not be cancelled: it is already past the point where it can stop.',
  [PackageCode.NoSpace]: 'There is not enough free space for this package. Free some space and try again.',
  [PackageCode.NotPackageFile]: 'This file is not a package this appliance can read. Check that you chose the right file.',
  [PackageCode.BadPackageFile]: 'This file is not a valid package. Get a fresh copy from its publisher.',
  [PackageCode.Conflict]: 'This package cannot be installed next to a package that is already installed.',
  [PackageCode.ServiceNotRunning]: 'A service this package needs is not running. Start it, then try again.',
  [PackageCode.DependencyMissing]: kNeedsOthers,
  [PackageCode.PortInUse]: 'The network port this package uses is taken by another program.',
  [PackageCode.NotSupported]: 'This package does not run on this appliance (another architecture or model, or a built-in package).',
  [PackageCode.UnsafeMember]: 'This package file holds unsafe content and was refused.',
  [PackageCode.Busy]: 'Another package operation is under way. Wait for it to finish, then try again.',
  [PackageCode.NoSignature]: 'This package is not signed.',
  [PackageCode.BadSignature]: 'This package\'s signature is not valid: the file was changed after it was signed.',
  [PackageCode.UnknownSigner]: 'This package is signed by a key this appliance does not trust. Import the publisher\'s key, or lower the trust level.',
  [PackageCode.ExpiredKey]: 'This package is signed with a key that has expired. Ask its publisher for a newer package.',
  [PackageCode.RevokedKey]: 'This package is signed with a key that has been revoked. Do not install it.',
  [PackageCode.RootNotTrusted]:
    'This package asks to run with full control of the appliance, which only a package signed by a key of the appliance keyring may. It was refused.',
  [PackageCode.OsTooNew]: 'This package does not support the appliance\'s system version, which is newer than it allows.',
  [PackageCode.OsTooOld]: 'This package needs a newer system version. Update the appliance first.',
  [PackageCode.ExtractFailed]: 'The package\'s contents could not be unpacked. The file may be damaged, or the volume full.',
  [PackageCode.UnsafePayload]: 'The package\'s contents hold unsafe files; the install was stopped.',
  [PackageCode.UpgradeRolledBack]: 'The upgrade failed; the previous version was restored.',
  [PackageCode.OtherOrigin]:
    'This package came from another source, or was signed by another key. It is upgraded only from where it came from, unless you switch its origin to this source.',
  [PackageCode.BadWizardValues]: 'The package did not accept the answers given in its install wizard. Check them and try again.',
  [PackageCode.InstallNotInstalled]: 'This package is not installed.',
  [PackageCode.NotNewer]: 'The same or a newer version of this package is already installed.',
  [PackageCode.InstallDependency]: 'This package needs other packages that are missing or stopped. Install or start them first.',
  [PackageCode.VersionLimit]: kVersionMismatch,
  [PackageCode.ScriptFailed]: 'A script of the package failed.',
  [PackageCode.Cancelled]: 'The install was cancelled.',
  [PackageCode.DependentsRunning]: 'Running packages depend on this one. Stop them first.',
  [PackageCode.NoRoomForDataCopy]:
    'The volume has no room for a safety copy of this package\'s data, which an upgrade takes first. Nothing was changed. Free some room, or upgrade without a safety copy.',
  [PackageCode.DataNotCopyable]:
    'This package\'s data holds something a safety copy cannot hold, so the upgrade was not started. Nothing was changed.',
  [PackageCode.NotFeasible]: 'The appliance does not allow this now.',
  [PackageCode.UninstallFailed]: 'The package could not be uninstalled.',
  [PackageCode.UninstallBadValues]: 'The answers of the uninstall wizard could not be read. Go back and answer again.',
  [PackageCode.UninstallDependents]: 'Other packages depend on this one. Uninstall them first.',
  [PackageCode.StartFailed]: 'The package could not be started.',
  [PackageCode.StopFailed]: 'The package could not be stopped.',
  [PackageCode.StopDependents]: 'Running packages need this one. Stop them first.',
  [PackageCode.StartVersionLimit]: kVersionMismatch,
  [PackageCode.StartDependency]: kNeedsOthers,
  [PackageCode.ImageNotFound]: 'This screenshot is not available.',
  [PackageCode.FeedNotServer]:
    'That address does not answer as a package source: it is down, too slow, not http or https, or not a package server. Check the address.',
  [PackageCode.FeedExists]: 'This package source is already in the list.',
  [PackageCode.KeyUnreadable]: 'The key file could not be read. Choose the publisher\'s key file again.',
  [PackageCode.KeyNotPublic]: 'This file holds no public signing key. Choose the publisher\'s public key file.',
  [PackageCode.KeySecret]: 'This file holds a secret key, which must never be imported. Ask the publisher for the public key.',
  [PackageCode.KeyringUnwritable]: 'The appliance\'s keyring could not be written. Check the system volume, then try again.',
  [PackageCode.NoRevision]: 'No earlier version of this package is kept.',
  [PackageCode.RevisionBusy]: 'Another operation on this package is under way. Wait for it to finish, then try again.',
  [PackageCode.RollbackFailed]: 'The rollback did not complete.',
  [PackageCode.DropFailed]: 'Some of the kept version could not be removed; the next package operation removes the rest.',
  [PackageCode.RevisionNotInstalled]: 'This package is not installed.',
  [PackageCode.LimitAboveBound]:
    'This package asks for more memory or more processes than this appliance allows a package. Raise the bounds in the package tool\'s settings, or ask its publisher for a package that needs less.',
  [PackageCode.NoAccountId]:
    'This package could not get a user of its own: the range of ids the package tool gives packages is full. Widen it in the package tool\'s settings, or remove a package you no longer need.',
  [PackageCode.AccountFiles]:
    'This package could not get a user of its own: the appliance\'s account files cannot be read or written. Check the system volume, then try again.',
  [PackageCode.UsageNotInstalled]: 'This package is not installed, so it uses nothing.',
  [PackageCode.HoldNotInstalled]: 'This package is not installed, so there is nothing to hold.',
  [PackageCode.AutoUpdateNotStored]: 'The schedule of automatic updates could not be saved. Check the system volume, then try again.',
  [PackageCode.HoldsUnreadable]: 'The stored holds of automatic updates are damaged, so automatic updates upgrade nothing. Set a hold again to replace them.',
};

// The name people know a package by, for its id; the id itself when the
// page knows no other (a package that is not installed).
export type NameOf = (id: string) => string;

const asItIs: NameOf = (id) => id;

// An answer's detail as words: a list of names (an array, or the keys of an
// object) joined with commas; a string as it stands, or the value it
// encodes when it is JSON text (the package tool hands some lists over as
// JSON text); a number as digits.
function names(value: unknown): string {
  if (typeof value === 'number') return String(value);
  if (typeof value === 'string') {
    const text = value.trim();
    if (/^["[{]/.test(text)) {
      try {
        return names(JSON.parse(text));
      } catch {
        // not JSON after all: shown as it stands
      }
    }
    return text;
  }
  if (Array.isArray(value)) return value.map(names).filter((n) => n !== '').join(', ');
  if (value !== null && typeof value === 'object') return Object.keys(value).join(', ');
  return '';
}

// A package's requirement on another (docs/package-format.md,
// "Dependencies"): an operator and a version, or neither for any version.
export interface Requirement {
  operator?: string;
  version?: string;
}

// What a requirement asks of the package `name`, in words.
export function needsWords(name: string, needs: Requirement): string {
  const v = needs.version;
  if (!needs.operator || !v) return `${name} (any version)`;
  switch (needs.operator) {
    case '>=':
      return `${name} ${v} or later`;
    case '>':
      return `${name} newer than ${v}`;
    case '<=':
      return `${name} ${v} or older`;
    case '<':
      return `${name} older than ${v}`;
    case '=':
      return `${name} ${v} exactly`;
    case '!=':
      return `any ${name} but ${v}`;
    default:
      return `${name} ${needs.operator} ${v}`;
  }
}

// One entry of a dependency list in its text form: an id, and an operator
// with a version when it asks for one ("demo-web>=1.0").
const kRequirementText = /^([A-Za-z0-9][A-Za-z0-9._+-]*?)(>=|<=|!=|=|<|>)(\S+)$/;

// A list of packages as names: each item of `names(value)` that is a
// package id the page knows becomes that package's display name, and a
// requirement in the text form becomes words.
function packageNames(value: unknown, nameOf: NameOf): string {
  const text = names(value);
  if (text === '') return '';
  return text
    .split(/,\s*/)
    .map((item) => {
      const requirement = kRequirementText.exec(item);
      return requirement ? needsWords(nameOf(requirement[1]), { operator: requirement[2], version: requirement[3] }) : nameOf(item);
    })
    .join(', ');
}

// "Label: names." when `value` names anything, else nothing.
function listed(label: string, value: unknown): string | undefined {
  const text = names(value);
  return text === '' ? undefined : `${label}: ${text}.`;
}

// The same for a list of packages, by their display names.
function listedPackages(label: string, value: unknown, nameOf: NameOf): string | undefined {
  const text = packageNames(value, nameOf);
  return text === '' ? undefined : `${label}: ${text}.`;
}

function seconds(count: number): string {
  if (count < 90) return count === 1 ? '1 second' : `${count} seconds`;
  return `${Math.ceil(count / 60)} minutes`;
}

function parameterProblem(e: Errors): string | undefined {
  if (typeof e.name !== 'string') return undefined;
  if (e.reason === 'required') return `"${e.name}" is missing.`;
  if (e.reason === 'type') return `"${e.name}" has the wrong type.`;
  return `"${e.name}" is not valid.`;
}

function feasibility(e: Errors): string[] {
  const reasons = names(e.reasons);
  if (e.check_type === 'soft') {
    return [reasons === '' ? 'It advises against it.' : `It advises against it: ${reasons}.`, 'Confirm to go ahead anyway.'];
  }
  return [reasons === '' ? 'The check could not be made; try again later.' : `Reason: ${reasons}.`];
}

function versions(e: Errors): string | undefined {
  const parts: string[] = [];
  if (typeof e.require_version === 'string' && e.require_version !== '') parts.push(`needed: ${e.require_version}`);
  if (typeof e.install_version === 'string' && e.install_version !== '') parts.push(`in this file: ${e.install_version}`);
  if (typeof e.current_version === 'string' && e.current_version !== '') parts.push(`installed: ${e.current_version}`);
  return parts.length === 0 ? undefined : `Version ${parts.join('; ')}.`;
}

function missingPackages(e: Errors, nameOf: NameOf): (string | undefined)[] {
  return [listedPackages('Not installed', e.uninstall_packages, nameOf), listedPackages('Not running', e.unstart_packages, nameOf)];
}

// Why the stored default volume cannot take packages.
const kVolumeStates: Record<string, string> = {
  no_space: 'is full',
  crashed: 'is damaged',
  no_found: 'is missing',
  unknown: 'cannot be used',
};

// The settings are stored one step after another; a failing step names
// itself, and those before it stay stored.
function failedStep(failed: unknown): string | undefined {
  if (typeof failed !== 'string') return undefined;
  const words = settingStepWords(failed);
  return words ? `the ${words}` : `"${failed}"`;
}

function generalFailure(e: Errors): (string | undefined)[] {
  const step = failedStep(e.failed);
  const volume = typeof e.volume_status === 'string' ? (kVolumeStates[e.volume_status] ?? 'cannot be used') : undefined;
  return [
    step && `Could not store ${step}; the settings before it were stored.`,
    volume && `The default volume ${volume}: choose another one in the settings.`,
  ];
}

function hostReason(e: Errors): string | undefined {
  return typeof e.reason === 'string' && e.reason !== '' ? `(${e.reason})` : undefined;
}

// What a code's "errors" add to its sentence, for the codes whose details
// say what stands in the way.
const details: Partial<Record<number, (e: Errors, nameOf: NameOf) => (string | undefined)[]>> = {
  [HostCode.Unknown]: (e) => [hostReason(e)],
  [HostCode.BadRequest]: (e) => [hostReason(e)],
  [HostCode.NotPermitted]: (e) => [hostReason(e)],
  [HostCode.Parameter]: (e) => [parameterProblem(e)],
  [HostCode.SignInThrottled]: (e) =>
    [typeof e.retry_after === 'number' ? `Try again in ${seconds(e.retry_after)}.` : 'Wait a while, then try again.'],
  [PackageCode.BadParameter]: (e) => [parameterProblem(e)],
  [PackageCode.Failed]: generalFailure,
  [PackageCode.Conflict]: (e, n) => [listedPackages('Conflicting packages', e.packages, n)],
  [PackageCode.ServiceNotRunning]: (e) => [listed('Services not running', e.services)],
  [PackageCode.DependencyMissing]: missingPackages,
  [PackageCode.StartDependency]: missingPackages,
  [PackageCode.PortInUse]: (e) => [typeof e.port === 'number' ? `Port ${e.port} is in use. Stop what uses it, then try again.` : undefined],
  [PackageCode.OsTooNew]: (e) => [listed('Newest system version it supports', e.firmware)],
  [PackageCode.OsTooOld]: (e) => [listed('System version it needs', e.firmware)],
  [PackageCode.NotNewer]: (e) => [versions(e)],
  [PackageCode.VersionLimit]: (e) => [versions(e)],
  [PackageCode.StartVersionLimit]: (e) => [versions(e)],
  [PackageCode.InstallDependency]: (e, n) => [listedPackages('Needed packages', e.packages, n)],
  [PackageCode.DependentsRunning]: (e, n) => [listedPackages('Running dependents', e.packages, n)],
  [PackageCode.UninstallDependents]: (e, n) => [listedPackages('Dependent packages', e.packages, n)],
  [PackageCode.StopDependents]: (e, n) => [listedPackages('Running dependents', e.packages, n)],
  [PackageCode.NotFeasible]: feasibility,
};

// The package tool's operation log can run to many lines; its last ones say
// how the operation ended.
const kToolLines = 3;

// The package tool's own words ("message", and "worker_message": what the
// package's scripts told the user), present on most package answers.
function toolWords(e: Errors): string[] {
  const said: string[] = [];
  if (typeof e.message === 'string') {
    const lines = e.message.split('\n').map((l) => l.trim()).filter((l) => l !== '');
    if (lines.length > 0) said.push(`The package tool said: ${lines.slice(-kToolLines).join(' ')}`);
  }
  if (Array.isArray(e.worker_message)) {
    for (const line of e.worker_message) {
      const text = names(line);
      if (text !== '' && !said.some((s) => s.includes(text))) said.push(text);
    }
  }
  return said;
}

// A start or stop of several packages fails as a whole with each package's
// own outcome under its id: {"<id>": {"code", "errors"}} or {"<id>": {"data"}}.
function batchFailures(e: Errors, nameOf: NameOf): string[] {
  if ('message' in e || 'worker_message' in e || 'code' in e) return [];
  const told: string[] = [];
  for (const [id, outcome] of Object.entries(e)) {
    if (outcome === null || typeof outcome !== 'object') continue;
    const { code, errors } = outcome as { code?: unknown; errors?: unknown };
    if (typeof code !== 'number') continue;
    const inner = errors !== null && typeof errors === 'object' ? (errors as Errors) : undefined;
    told.push(`${nameOf(id)}: ${messageFor({ code, errors: inner }, nameOf)}`);
  }
  return told;
}

export interface Explanation {
  // What happened and what to do.
  summary: string;
  // What the answer's details add: names of packages, versions, reasons, the
  // package tool's words, one sentence each.
  details: string[];
}

// `failure` explained in parts, for a screen that shows the details apart
// (a list of reasons, say). messageFor joins the same parts. `nameOf` gives
// the packages the answer names by id their display names.
export function explain(failure: ApiFailure, nameOf: NameOf = asItIs): Explanation {
  const errors = failure.errors ?? {};
  const summary = messages[failure.code] ?? `The appliance answered with error ${failure.code}.`;
  const own = details[failure.code]?.(errors, nameOf) ?? [];
  const parts = [...own, ...batchFailures(errors, nameOf), ...toolWords(errors)];
  return { summary, details: parts.filter((p): p is string => p !== undefined && p !== '') };
}

// The sentence for `failure`, with the details the answer carries that a
// user can act on.
export function messageFor(failure: ApiFailure, nameOf: NameOf = asItIs): string {
  const { summary, details: told } = explain(failure, nameOf);
  return [summary, ...told].join(' ');
}
