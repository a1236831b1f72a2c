// The install wizard's pages that every install shows, whether the package
// came as an uploaded file or from a package server: the licence to accept,
// the package's own wizard pages, the volume to install to and a summary.
//
// Contract:
// - Each builder returns StepPage(s) for ui/steps.tsx and holds no state:
//   the flow keeps an `InstallChoices` (useState) and rebuilds the pages on
//   every render, passing the choices in and a setter out. Pages whose
//   answers are incomplete carry a `problem`, so Steps keeps the user there.
// - `InstallSteps` runs those pages as a Back/Next flow that keeps the
//   choices itself, after pages of the flow's own, and hands the choices
//   to `onFinish`.
// - `installPages` builds the whole sequence from what the API said about the
//   package (`PackageFacts`: the licence and wizard pages as the API sends
//   them, URL-encoded) and the volumes (`readVolumes` of a `check` or
//   Setting "get" answer). A package without a licence or wizard simply has
//   no such page.
// - `initialChoices` preselects the volume: the one the package is already
//   installed on (an upgrade), else the default install volume, else the
//   first listed.
// - `installParams` turns the choices into the parameters `install` takes
//   (`volume_path`, `extra_values`: the wizard's answers as JSON text).
// - `CheckRefusal` shows why the environment check (or the upload's
//   inspection, which makes the same tests, or the install) refused, with
//   the packages (by their display names), services or system versions the
//   answer names.
// - `checkEnvironment` runs the environment check and reads the default
//   volume, and gives the volumes and first choices for the pages.

import './install-pages.css';
import { useState } from 'preact/hooks';
import type { Api, ApiFailure, Params, Result } from '../api/client';
import { checkInstall, type InstallValues } from '../api/installation';
import { explain } from '../api/messages';
import type { PackagePermissions } from '../api/permissions';
import { getDefaultVolume } from '../api/setting';
import { useSession } from '../session';
import { usePackageNames } from './package-names';
import { PermissionsSection, permissionsProblem } from './package-permissions';
import { Steps, type StepPage } from './steps';
import { decodeWizard, initialWizardValues, WizardStepForm, wizardStepProblem, type WizardStep, type WizardValues } from './wizard';

export interface Volume {
  path: string;
  freeBytes: number | null;
  totalBytes: number | null;
}

export interface PackageFacts {
  id: string;
  name: string;
  version: string;
  licence?: unknown;
  installPages?: unknown;
  // The version this install replaces, for an upgrade.
  replaces?: string;
  // What it will be allowed to do (ui/package-permissions.tsx).
  permissions?: PackagePermissions;
}

export interface InstallChoices {
  licenceAccepted: boolean;
  wizard: WizardValues;
  volume: string;
  // Whether the package starts once installed, where the flow lets the user
  // choose (the summary then asks); undefined where the flow decides.
  startAfter?: boolean;
  // The administrator allowed a package that asks for root to run as root.
  rootConfirmed?: boolean;
}

function isObject(value: unknown): value is Record<string, unknown> {
  return typeof value === 'object' && value !== null && !Array.isArray(value);
}

function byteCount(value: unknown): number | null {
  const n = typeof value === 'string' ? Number(value) : typeof value === 'number' ? value : NaN;
  return Number.isFinite(n) && n >= 0 ? n : null;
}

// The volumes listed in an answer of `check` or of Setting "get" (both carry
// "volumes": [{"volume_path", "size_free_byte", "size_total_byte", ...}]).
export function readVolumes(answer: unknown): Volume[] {
  if (!isObject(answer) || !Array.isArray(answer.volumes)) return [];
  return answer.volumes
    .filter((v): v is Record<string, unknown> => isObject(v) && typeof v.volume_path === 'string' && v.volume_path !== '')
    .map((v) => ({ path: v.volume_path as string, freeBytes: byteCount(v.size_free_byte), totalBytes: byteCount(v.size_total_byte) }));
}

// The licence text the API sent URL-encoded, or null when there is none.
export function decodeLicence(encoded: unknown): string | null {
  if (typeof encoded !== 'string' || encoded === '') return null;
  try {
    return decodeURIComponent(encoded);
  } catch {
    return encoded;
  }
}

// What the environment check says, made ready for the install pages.
export interface Environment<T> {
  answer: T;
  volumes: Volume[];
  choices: InstallChoices;
  // The default volume could not be read: the volume page still works, with
  // no default preselected.
  defaultVolumeError: ApiFailure | null;
}

// Runs the environment check ("Installation" "check", version 2, with
// `params`) and reads the default volume at the same time, then offers the
// check's volumes with the right one preselected. A refused check answers
// its failure.
export async function checkEnvironment<T extends { volume_path?: string }>(
  api: Api,
  facts: PackageFacts,
  params: Params,
): Promise<Result<Environment<T>>> {
  const [check, defaultVolume] = await Promise.all([checkInstall<T>(api, params), getDefaultVolume(api)]);
  if (!check.ok) return check;
  const volumes = readVolumes(check.data);
  const choices = initialChoices(facts, volumes, check.data.volume_path ?? '', defaultVolume.ok ? defaultVolume.data : '');
  return { ok: true, data: { answer: check.data, volumes, choices, defaultVolumeError: defaultVolume.ok ? null : defaultVolume.error } };
}

// `installedOn` is the volume of an already installed version (check's
// "volume_path"), `defaultVolume` the appliance's default install volume.
export function initialChoices(facts: PackageFacts, volumes: Volume[], installedOn: string, defaultVolume: string): InstallChoices {
  const listed = (path: string) => path !== '' && volumes.some((v) => v.path === path);
  const volume = [installedOn, defaultVolume].find(listed) ?? volumes[0]?.path ?? '';
  const steps = decodeWizard(facts.installPages);
  return { licenceAccepted: false, wizard: steps ? initialWizardValues(steps) : {}, volume };
}

export function installParams(facts: PackageFacts, choices: InstallChoices): InstallValues {
  const hasWizard = decodeWizard(facts.installPages) !== null;
  return { volume_path: choices.volume, extra_values: hasWizard ? JSON.stringify(choices.wizard) : undefined };
}

type Change = (next: InstallChoices) => void;

export function licencePage(text: string, choices: InstallChoices, onChange: Change): StepPage {
  return {
    title: 'Licence',
    body: (
      <>
        <p>Read the package's licence. You can install the package only if you accept it.</p>
        <div class="licence" tabIndex={0} role="document" aria-label="Licence text">
          {text}
        </div>
        <label class="choice">
          <input
            type="checkbox"
            checked={choices.licenceAccepted}
            onChange={(e) => onChange({ ...choices, licenceAccepted: e.currentTarget.checked })}
          />{' '}
          I accept the licence
        </label>
      </>
    ),
    problem: choices.licenceAccepted ? null : 'Accept the licence to go on.',
  };
}

export function wizardPages(steps: WizardStep[], choices: InstallChoices, onChange: Change): StepPage[] {
  return steps.map((step, i) => ({
    title: step.step_title || `Settings ${i + 1}`,
    body: <WizardStepForm step={step} values={choices.wizard} onChange={(wizard) => onChange({ ...choices, wizard })} />,
    problem: wizardStepProblem(step, choices.wizard),
  }));
}

export function formatBytes(bytes: number): string {
  const units = ['bytes', 'KB', 'MB', 'GB', 'TB'];
  let value = bytes;
  let unit = 0;
  while (value >= 1000 && unit < units.length - 1) {
    value /= 1000;
    ++unit;
  }
  return unit === 0 ? `${value} bytes` : `${value.toFixed(1)} ${units[unit]}`;
}

function volumeText(volume: Volume): string {
  if (volume.freeBytes === null) return volume.path;
  const total = volume.totalBytes ? ` of ${formatBytes(volume.totalBytes)}` : '';
  return `${volume.path} (${formatBytes(volume.freeBytes)} free${total})`;
}

export function volumePage(volumes: Volume[], choices: InstallChoices, onChange: Change): StepPage {
  return {
    title: 'Volume',
    body: (
      <fieldset>
        <legend>Install on volume</legend>
        {volumes.map((v) => (
          <label class="choice" key={v.path}>
            <input
              type="radio"
              name="install-volume"
              value={v.path}
              checked={choices.volume === v.path}
              onChange={() => onChange({ ...choices, volume: v.path })}
            />{' '}
            {volumeText(v)}
          </label>
        ))}
      </fieldset>
    ),
    problem: volumes.length === 0 ? 'The appliance has no volume to install to.' : choices.volume === '' ? 'Choose a volume.' : null,
  };
}

export function summaryPage(facts: PackageFacts, choices: InstallChoices, extra: { label: string; value: string }[] = [], onChange?: Change): StepPage {
  const rows = [
    { label: 'Package', value: facts.name || facts.id },
    ...(facts.replaces !== undefined ? [{ label: 'Installed now', value: facts.replaces }] : []),
    { label: facts.replaces !== undefined ? 'New version' : 'Version', value: facts.version },
    { label: 'Volume', value: choices.volume },
    ...extra,
  ];
  return {
    title: 'Summary',
    body: (
      <>
        <p>{facts.replaces !== undefined ? 'The package will replace the installed version, with these choices.' : 'The package will be installed with these choices.'}</p>
        <dl class="summary">
          {rows.map((r) => (
            <div key={r.label}>
              <dt>{r.label}</dt>
              <dd>{r.value}</dd>
            </div>
          ))}
        </dl>
        {facts.permissions && <PermissionsSection name={facts.name || facts.id} permissions={facts.permissions} choices={choices} onChange={onChange} />}
        {choices.startAfter !== undefined && onChange && (
          <label class="choice">
            <input type="checkbox" checked={choices.startAfter} onChange={(e) => onChange({ ...choices, startAfter: e.currentTarget.checked })} /> Start{' '}
            {facts.name || facts.id} once it is installed
          </label>
        )}
      </>
    ),
    problem: facts.permissions ? permissionsProblem(facts.name || facts.id, facts.permissions, choices) : null,
  };
}

// Every page of an install, in order: licence, the package's wizard,
// volume, summary (with what the package may do).
export function installPages(facts: PackageFacts, volumes: Volume[], choices: InstallChoices, onChange: Change): StepPage[] {
  const licence = decodeLicence(facts.licence);
  const steps = decodeWizard(facts.installPages);
  return [
    ...(licence !== null ? [licencePage(licence, choices, onChange)] : []),
    ...(steps ? wizardPages(steps, choices, onChange) : []),
    volumePage(volumes, choices, onChange),
    summaryPage(facts, choices, [], onChange),
  ];
}

// The install pages as a Back/Next flow from the choices `start`, after the
// flow's own pages `before` (which may depend on state of the flow's own);
// Finish hands the choices to `onFinish`.
export function InstallSteps({
  facts,
  volumes,
  start,
  before = [],
  busy,
  finishLabel = 'Install',
  onFinish,
  onCancel,
}: {
  facts: PackageFacts;
  volumes: Volume[];
  start: InstallChoices;
  before?: StepPage[];
  busy?: boolean;
  finishLabel?: string;
  onFinish: (choices: InstallChoices) => void;
  onCancel: () => void;
}) {
  const [choices, setChoices] = useState(start);
  const pages = [...before, ...installPages(facts, volumes, choices, setChoices)];
  return <Steps pages={pages} finishLabel={finishLabel} onFinish={() => onFinish(choices)} onCancel={onCancel} busy={busy} />;
}

// A refusal of the environment check, of a package file or of an install,
// in words: what happened, then each thing the answer names as in the way,
// one line each.
export function CheckRefusal({ error }: { error: ApiFailure }) {
  const { api } = useSession();
  const nameOf = usePackageNames(api, true);
  const { summary, details } = explain(error, nameOf);
  return (
    <div class="refusal" role="alert" data-code={error.code}>
      <p class="error">{summary}</p>
      {details.length > 0 && (
        <ul>
          {details.map((d) => (
            <li key={d}>{d}</li>
          ))}
        </ul>
      )}
    </div>
  );
}
