// The upgrade of an installed package to the version a package server
// offers, in one dialog from the download to its end, opened from the
// catalogue, the installed list and the package's page alike: "Upgrade Demo
// Web from 1.0.0-0001 to 1.1.0-0001", the new version's release notes
// (ui/release-notes.tsx), the download, the install wizard
// (ui/server-install.tsx), the upgrade's progress and how it ended. The work runs in the appliance's
// task; closing the dialog leaves it running there.
//
// Packages that need this one may run meanwhile: the package tool judges
// whether the new version still suits them. When it does not (the tool's
// 269, naming the package in "deppkg"), the dialog says which package and
// what it needs, and offers to stop it, upgrade, and start it again, then
// says what each step did and what runs now.

import './upgrade-flow.css';
import { useCallback, useEffect, useRef, useState } from 'preact/hooks';
import type { Api, ApiFailure } from '../api/client';
import { ToolCode } from '../api/codes';
import { controlPackages } from '../api/control';
import { quickInstall, startDownload, startedTaskId, type InstallValues } from '../api/installation';
import { messageFor, needsWords, type Requirement } from '../api/messages';
import { getPackage, listPackages } from '../api/package';
import { listCatalogue, markUpgradesSeen, type ServerEntry } from '../api/server';
import { useSession } from '../session';
import { Dialog } from './dialog';
import { ErrorText } from './error-text';
import { ReleaseNotes } from './release-notes';
import { ServerInstallBody } from './server-install';
import { TaskProgress, type TaskEnd } from './task-progress';
import { restoreWords, UpgradeRestored, type RestoreWords } from './upgrade-restored';

// The installed package an upgrade replaces.
export interface Installed {
  name: string;
  version: string;
}

// Where an upgrade under way is picked up: its download done and waiting
// for the wizard (a card's "Continue install").
export interface UpgradeResume {
  downloaded: string;
}

// A package that needs the one upgraded, with what it needs of it.
export interface Dependent {
  id: string;
  name: string;
  needs: Requirement;
}

// One step of "stop, upgrade, start again" and how it went.
interface ActionStep {
  label: string;
  state: 'waiting' | 'running' | 'done' | 'failed' | 'skipped';
  text?: string;
}

type Stage =
  | { kind: 'starting' }
  | { kind: 'downloading'; taskId: string }
  | { kind: 'wizard'; taskId: string }
  | { kind: 'upgrading'; taskId: string; values: InstallValues }
  | { kind: 'done'; now: string[] }
  | { kind: 'failed'; text: string; error?: ApiFailure }
  | { kind: 'restored'; restore: RestoreWords; now: string[] }
  | { kind: 'noCopyRoom'; text: string; values: InstallValues }
  | { kind: 'blocked'; dependent: Dependent; values: InstallValues; now: string[] }
  | { kind: 'acting'; dependent: Dependent; values: InstallValues }
  | { kind: 'acted'; steps: ActionStep[]; now: string[] };

interface DependentFields {
  status?: string;
  dependent_packages?: Record<string, Requirement> | null;
}

// The installed packages that need `id` and run now.
async function runningDependents(api: Api, id: string): Promise<Dependent[]> {
  const listed = await listPackages<DependentFields>(api, ['status', 'dependent_packages']);
  if (!listed.ok) return [];
  return listed.data.packages
    .filter((p) => p.additional?.status === 'running' && p.additional.dependent_packages?.[id] !== undefined)
    .map((p) => ({ id: p.id, name: p.name, needs: p.additional?.dependent_packages?.[id] ?? {} }));
}

// The package `id` as the appliance has it now, in words ("Demo Web
// 1.1.0-0001 is installed and running."), read afresh: the dialog never
// tells a state it did not check.
async function stateNow(api: Api, id: string, fallbackName: string): Promise<string> {
  const got = await getPackage<{ status?: string }>(api, id, ['status']);
  if (!got.ok) return `${fallbackName}: its state could not be read (${messageFor(got.error)})`;
  const status = got.data.additional?.status;
  const how = status === 'running' ? 'installed and running' : status === 'stop' ? 'installed and stopped' : `installed (${status ?? 'state unknown'})`;
  return `${got.data.name} ${got.data.version} is ${how}.`;
}

// The dependent that refused an upgrade, with what it needs of `entry`.
async function refusingDependent(api: Api, entry: ServerEntry, id: string): Promise<Dependent> {
  const got = await getPackage<DependentFields>(api, id, ['dependent_packages']);
  if (!got.ok) return { id, name: id, needs: {} };
  return { id, name: got.data.name, needs: got.data.additional?.dependent_packages?.[entry.id] ?? {} };
}

export function UpgradeFlow({
  entry,
  installed,
  resume,
  onClose,
}: {
  entry: ServerEntry;
  // Known where the page lists it; otherwise read from the appliance.
  installed?: Installed;
  resume?: UpgradeResume;
  onClose: () => void;
}) {
  const { api } = useSession();
  const current = useInstalled(api, entry.id, installed);
  const [stage, setStage] = useState<Stage>(resume ? { kind: 'wizard', taskId: resume.downloaded } : { kind: 'starting' });
  const [dependents, setDependents] = useState<Dependent[]>([]);
  const name = current?.name ?? entry.dname ?? entry.id;
  const to = offeredVersion(entry);

  useEffect(() => {
    let live = true;
    void runningDependents(api, entry.id).then((found) => live && setDependents(found));
    return () => {
      live = false;
    };
  }, [api, entry.id]);

  // The download is asked for once, as the dialog opens (a download already
  // under way for the package is followed instead).
  const starting = stage.kind === 'starting';
  useEffect(() => {
    if (!starting) return;
    let live = true;
    void startDownload(api, entry, false).then((answer) => {
      if (!live) return;
      if (answer.ok) setStage({ kind: 'downloading', taskId: startedTaskId(answer.data, entry.id) });
      else setStage({ kind: 'failed', text: `The download of ${entry.dname || entry.id} ${entry.version ?? ''} could not start.`, error: answer.error });
    });
    return () => {
      live = false;
    };
  }, [api, entry, starting]);

  // Escape closes the dialog; in the wizard it does what the wizard's
  // Cancel does (which may drop a download the appliance refused).
  const [escapes, setEscapes] = useState(0);

  const afterUpgrade = useCallback(
    async (end: TaskEnd, values: InstallValues) => {
      if (end.kind === 'failed' && end.result === ToolCode.DependentsRunning && end.dependent) {
        const dependent = await refusingDependent(api, entry, end.dependent);
        return setStage({ kind: 'blocked', dependent, values, now: [await stateNow(api, entry.id, name)] });
      }
      if (end.kind === 'failed' && end.result === ToolCode.NoRoomForDataCopy) {
        // The tool's first line says what was short; the rest is its log.
        return setStage({ kind: 'noCopyRoom', text: (end.message ?? end.text).split('\n')[0], values });
      }
      if (end.kind === 'failed' && end.result === ToolCode.UpgradeRolledBack) {
        return setStage({ kind: 'restored', restore: restoreWords(end.message), now: [await stateNow(api, entry.id, name)] });
      }
      if (end.kind === 'failed') return setStage({ kind: 'failed', text: end.text });
      // Done, or read to its end by another page: what is installed now says
      // how it went.
      const now = [await stateNow(api, entry.id, name)];
      for (const d of await dependentsNow(api, dependents)) now.push(d);
      const got = await getPackage(api, entry.id, []);
      if (got.ok && got.data.version === entry.version) return setStage({ kind: 'done', now });
      setStage({ kind: 'failed', text: `The upgrade ended without installing ${to}. ${now.join(' ')}` });
    },
    [api, entry, name, to, dependents],
  );

  // The steps of the action are run from this dialog: it stays until they end.
  const escape = stage.kind === 'acting' ? () => {} : stage.kind === 'wizard' ? () => setEscapes((n) => n + 1) : onClose;
  const title = current ? `Upgrade ${name} from ${current.version} to ${to}` : `Upgrade ${name} to ${to}`;
  return (
    <Dialog title={title} onClose={escape} wide>
      <ReleaseNotes version={to} notes={entry.changelog} description={entry.desc} />
      {stage.kind !== 'done' && stage.kind !== 'acted' && stage.kind !== 'blocked' && stage.kind !== 'restored' && <DependentsNote name={name} dependents={dependents} />}
      <StageView
        stage={stage}
        entry={entry}
        name={name}
        from={current?.version}
        escapes={escapes}
        onStage={setStage}
        afterUpgrade={afterUpgrade}
        onClose={onClose}
      />
    </Dialog>
  );
}

// The installed package: as given, else read once from the appliance.
function useInstalled(api: Api, id: string, given: Installed | undefined): Installed | null {
  const [read, setRead] = useState<Installed | null>(null);
  useEffect(() => {
    if (given) return;
    let live = true;
    void getPackage(api, id, []).then((got) => live && got.ok && setRead({ name: got.data.name, version: got.data.version }));
    return () => {
      live = false;
    };
  }, [api, id, given]);
  return given ?? read;
}

// The dependents that ran before, as they are now.
async function dependentsNow(api: Api, before: Dependent[]): Promise<string[]> {
  const running = new Set((await Promise.all(before.map((d) => getPackage<{ status?: string }>(api, d.id, ['status'])))).map((g, i) =>
    g.ok && g.data.additional?.status === 'running' ? before[i].id : '',
  ));
  return before.map((d) => (running.has(d.id) ? `${d.name} still runs.` : `${d.name} does not run now.`));
}

function DependentsNote({ name, dependents }: { name: string; dependents: Dependent[] }) {
  if (dependents.length === 0) return null;
  return (
    <div class="dependents-note">
      <p>Running packages that need {name}:</p>
      <ul>
        {dependents.map((d) => (
          <li key={d.id}>
            {d.name} needs {needsWords(name, d.needs)}.
          </li>
        ))}
      </ul>
      <p class="hint">They keep running. The package tool upgrades only if the new version still suits them.</p>
    </div>
  );
}

function CloseButton({ onClose, label = 'Close' }: { onClose: () => void; label?: string }) {
  return (
    <div class="buttons">
      <button type="button" class="primary" onClick={onClose}>
        {label}
      </button>
    </div>
  );
}

// What a stage with a view of its own is given: the stage, the offered
// entry, the package's name, and the way on to the next stage.
interface StageProps<Kind extends Stage['kind']> {
  stage: Extract<Stage, { kind: Kind }>;
  entry: ServerEntry;
  name: string;
  onStage: (stage: Stage) => void;
}

// The offered version as the dialog names it, also when the server names none.
function offeredVersion(entry: ServerEntry): string {
  return entry.version ?? 'the new version';
}

function StageView({
  stage,
  entry,
  name,
  from,
  escapes,
  onStage,
  afterUpgrade,
  onClose,
}: {
  stage: Stage;
  entry: ServerEntry;
  name: string;
  from: string | undefined;
  escapes: number;
  onStage: (stage: Stage) => void;
  afterUpgrade: (end: TaskEnd, values: InstallValues) => Promise<void>;
  onClose: () => void;
}) {
  const to = offeredVersion(entry);
  switch (stage.kind) {
    case 'starting':
      return <p class="hint">Starting the download of {name}…</p>;
    case 'downloading':
      return (
        <>
          <TaskProgress taskId={stage.taskId} name={`${name} ${to}`} onEnd={(end) => onStage(downloadEnd(end, stage.taskId, name))} />
          <p class="hint">The download goes on when this dialog is closed.</p>
        </>
      );
    case 'wizard':
      // The wizard says which version it replaces: it waits for it.
      if (from === undefined) return <p class="loading">Reading the installed version…</p>;
      return (
        <ServerInstallBody
          entry={entry}
          taskId={stage.taskId}
          upgradeFrom={from}
          closeRequests={escapes}
          onClose={(outcome) => {
            if (outcome.kind === 'started') onStage({ kind: 'upgrading', taskId: outcome.taskId, values: outcome.values });
            else if (outcome.kind === 'discarded' && outcome.reason) onStage({ kind: 'failed', text: outcome.reason });
            else onClose();
          }}
        />
      );
    case 'upgrading':
      return (
        <>
          <TaskProgress taskId={stage.taskId} name={name} onEnd={(end) => void afterUpgrade(end, stage.values)} />
          <p class="hint">The upgrade goes on when this dialog is closed.</p>
        </>
      );
    case 'done':
      return (
        <>
          <p role="status" class="upgrade-done">
            {name} is upgraded to {to}.
          </p>
          <Now lines={stage.now} />
          <CloseButton onClose={onClose} />
        </>
      );
    case 'failed':
      return (
        <>
          <p role="alert" class="error">
            {stage.text}
          </p>
          <ErrorText error={stage.error} />
          <CloseButton onClose={onClose} />
        </>
      );
    case 'restored':
      return (
        <>
          <UpgradeRestored name={name} to={to} from={from} restore={stage.restore} />
          <Now lines={stage.now} />
          <CloseButton onClose={onClose} />
        </>
      );
    case 'blocked':
      return <Blocked stage={stage} entry={entry} name={name} onStage={onStage} onClose={onClose} />;
    case 'noCopyRoom':
      return <NoCopyRoom stage={stage} entry={entry} name={name} onStage={onStage} onClose={onClose} />;
    case 'acting':
      return <Acting stage={stage} entry={entry} name={name} onStage={onStage} />;
    case 'acted':
      return (
        <>
          <Steps steps={stage.steps} />
          <Now lines={stage.now} />
          <CloseButton onClose={onClose} />
        </>
      );
  }
}

function downloadEnd(end: TaskEnd, taskId: string, name: string): Stage {
  if (end.kind === 'done' && end.data.status === 'downloaded' && !end.data.blqinst) return { kind: 'wizard', taskId };
  if (end.kind === 'failed') return { kind: 'failed', text: end.text };
  if (end.kind === 'cancelled') return { kind: 'failed', text: `The download of ${name} was cancelled; nothing was changed.` };
  return { kind: 'failed', text: `The download of ${name} was ended elsewhere (another page discarded it); nothing was changed.` };
}

function Now({ lines }: { lines: string[] }) {
  if (lines.length === 0) return null;
  return (
    <div class="upgrade-now">
      <h3>Now</h3>
      <ul>
        {lines.map((l) => (
          <li key={l}>{l}</li>
        ))}
      </ul>
    </div>
  );
}

// The upgrade would break a running package: which, what it needs, and the
// action that stops it for the upgrade and starts it again.
function Blocked({ stage, entry, name, onStage, onClose }: StageProps<'blocked'> & { onClose: () => void }) {
  const { dependent, values } = stage;
  const to = offeredVersion(entry);
  return (
    <>
      <div role="alert" class="upgrade-blocked">
        <p>
          <strong>
            {name} {to} was not installed: {dependent.name} runs and needs {needsWords(name, dependent.needs)}, which {to} is not.
          </strong>
        </p>
        <p>The upgrade can go ahead while {dependent.name} is stopped.</p>
      </div>
      <Now lines={stage.now} />
      <p class="hint">
        The action below stops {dependent.name}, upgrades {name} with the settings you chose, and starts {dependent.name} again. While it
        needs {needsWords(name, dependent.needs)}, it will not start beside {to}; the dialog will say so.
      </p>
      <div class="buttons">
        <button type="button" onClick={onClose}>
          Close
        </button>
        <button type="button" class="primary" onClick={() => onStage({ kind: 'acting', dependent, values })}>
          Stop {dependent.name}, upgrade, start it again
        </button>
      </div>
    </>
  );
}

// The volume has no room for the safety copy of the data that the upgrade
// takes first; nothing was changed. The administrator may upgrade without
// it, knowing what that gives up.
function NoCopyRoom({ stage, entry, name, onStage, onClose }: StageProps<'noCopyRoom'> & { onClose: () => void }) {
  const { api } = useSession();
  const [error, setError] = useState<ApiFailure | undefined>();
  const to = offeredVersion(entry);
  const goOn = async () => {
    const started = await quickInstall(api, entry, stage.values, { withoutDataCopy: true });
    if (started.ok) onStage({ kind: 'upgrading', taskId: startedTaskId(started.data, entry.id), values: stage.values });
    else setError(started.error);
  };
  return (
    <>
      <div role="alert" class="upgrade-blocked">
        <p>
          <strong>{stage.text}</strong>
        </p>
      </div>
      <p class="hint">
        Before an upgrade the appliance copies {name}&apos;s data, so that a failed upgrade can bring it back. Without the copy, {to} is
        installed all the same, but if it fails, the data it changed cannot be brought back. Freeing room on the volume (for example by
        dropping earlier versions kept on the packages&apos; pages) avoids the choice.
      </p>
      <ErrorText error={error} />
      <div class="buttons">
        <button type="button" onClick={onClose}>
          Close
        </button>
        <button type="button" class="primary" onClick={() => void goOn()}>
          Upgrade without a safety copy
        </button>
      </div>
    </>
  );
}

// The steps of "stop, upgrade, start again" as they go. A step that fails
// is said with its reason; the dependent is started again whether the
// upgrade worked or not (it ran before), and the end says what runs now,
// read from the appliance.
function Acting({ stage, entry, name, onStage }: StageProps<'acting'>) {
  const { api } = useSession();
  const { dependent, values } = stage;
  const to = offeredVersion(entry);
  const [steps, setSteps] = useState<ActionStep[]>(() => [
    { label: `Stop ${dependent.name}`, state: 'waiting' },
    { label: `Upgrade ${name} to ${to}`, state: 'waiting' },
    { label: `Start ${dependent.name} again`, state: 'waiting' },
  ]);
  const [taskId, setTaskId] = useState<string | null>(null);
  const upgradeEnded = useRef<(end: TaskEnd) => void>(() => {});
  // The two packages the steps concern, by the names people know.
  const nameOf = (id: string) => (id === entry.id ? name : id === dependent.id ? dependent.name : id);

  useEffect(() => {
    const done = [...steps];
    const mark = (i: number, state: ActionStep['state'], text?: string) => {
      done[i] = { ...done[i], state, text };
      setSteps([...done]);
    };
    const upgrade = async (): Promise<void> => {
      mark(1, 'running');
      const started = await quickInstall(api, entry, values, {});
      if (!started.ok) return mark(1, 'failed', messageFor(started.error, nameOf));
      const ended = new Promise<TaskEnd>((resolve) => (upgradeEnded.current = resolve));
      setTaskId(startedTaskId(started.data, entry.id));
      const end = await ended;
      setTaskId(null);
      if (end.kind === 'failed') return mark(1, 'failed', end.text);
      const got = await getPackage(api, entry.id, []);
      if (got.ok && got.data.version === entry.version) mark(1, 'done', `${name} ${to} is installed.`);
      else mark(1, 'failed', `The upgrade ended without installing ${to}.`);
    };
    void (async () => {
      mark(0, 'running');
      const stopped = await controlPackages(api, 'stop', [dependent.id]);
      if (!stopped.ok) {
        mark(0, 'failed', messageFor(stopped.error, nameOf));
        mark(1, 'skipped', `Not tried: ${dependent.name} still runs.`);
        mark(2, 'skipped', `Not needed: ${dependent.name} was not stopped.`);
      } else {
        mark(0, 'done', `${dependent.name} was stopped.`);
        await upgrade();
        mark(2, 'running');
        const again = await controlPackages(api, 'start', [dependent.id]);
        mark(2, again.ok ? 'done' : 'failed', again.ok ? `${dependent.name} was started again.` : messageFor(again.error, nameOf));
      }
      const now = await Promise.all([stateNow(api, entry.id, name), stateNow(api, dependent.id, dependent.name)]);
      onStage({ kind: 'acted', steps: done, now });
    })();
    // The steps run once, as the action was chosen.
  }, []);

  return (
    <>
      <Steps steps={steps} />
      {taskId && <TaskProgress taskId={taskId} name={name} onEnd={(end) => upgradeEnded.current(end)} />}
      <p class="hint">Keep this page open until the steps are done: they are run from here, one after the other.</p>
    </>
  );
}

const kStepWords: Record<ActionStep['state'], string> = {
  waiting: 'Waiting',
  running: 'Under way',
  done: 'Done',
  failed: 'Failed',
  skipped: 'Skipped',
};

function Steps({ steps }: { steps: ActionStep[] }) {
  return (
    <ol class="action-steps" aria-label="Steps">
      {steps.map((step) => (
        <li key={step.label} class={`step-${step.state}`}>
          <strong>{step.label}</strong>: {kStepWords[step.state]}
          {step.text ? `. ${step.text}` : ''}
        </li>
      ))}
    </ol>
  );
}

// The upgrades the package servers offer for installed packages: the
// catalogue entry of each newer version, by package id (the vendor's first,
// then the feeds'). Asked once per visit: the catalogue changes seldom, and
// the appliance caches it. With `markSeen`, the appliance is told the user
// has seen them, which refreshes its upgrade count on the desktop.
// `asked` numbers the asking: a new number asks again (after an upgrade,
// which changes what is offered).
export function useUpgradeOffers(api: Api, markSeen: boolean, asked = 0): { offers: Map<string, ServerEntry>; error: ApiFailure | null } {
  const [state, setState] = useState<{ offers: Map<string, ServerEntry>; error: ApiFailure | null }>({ offers: new Map(), error: null });
  useEffect(() => {
    let live = true;
    void Promise.all([listCatalogue(api, { others: false }), listCatalogue(api, { others: true })]).then(async (answers) => {
      const offers = new Map<string, ServerEntry>();
      let error: ApiFailure | null = null;
      for (const answer of answers) {
        if (!answer.ok) {
          error = answer.error;
          continue;
        }
        for (const entry of answer.data.data ?? []) if (entry.blupgrade && entry.id && entry.version && !offers.has(entry.id)) offers.set(entry.id, entry);
      }
      if (live) setState({ offers, error });
      if (!markSeen || offers.size === 0 || !live) return;
      const seen = await markUpgradesSeen(api);
      if (!seen.ok && live) setState({ offers, error: seen.error });
    });
    return () => {
      live = false;
    };
  }, [api, markSeen, asked]);
  return state;
}
