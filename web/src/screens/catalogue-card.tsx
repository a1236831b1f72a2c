// One package of the catalogue: its icon, name, version and marks (beta,
// upgrade, installed), description and source, and what can be done with it
// now, which depends on its phase (a task under way, a download waiting for
// its wizard, a note on the last attempt).

import { useCallback, useEffect, useRef } from 'preact/hooks';
import { entryIconUrl } from '../api/images';
import { taskStatus, type TaskData } from '../api/installation';
import type { ServerEntry } from '../api/server';
import { useSession } from '../session';
import { usePoll } from '../ui/poll';
import { kBusyPollMs } from '../ui/status-badge';
import { TaskProgress, type TaskEnd } from '../ui/task-progress';
import { isInstalled, type Phase } from './catalogue-state';

// What the buttons and the followed task of a card do.
export interface EntryActions {
  onInstall: () => void;
  onUpgrade: () => void;
  onSwitch: () => void;
  onEnd: (end: TaskEnd) => void;
  // A download waiting for its wizard changed on the appliance (another
  // page went on with it, or discarded it): its task's data now.
  onWaitingChanged: (data: TaskData) => void;
  onContinue: () => void;
  onDiscard: () => void;
}

const kInstalledWords: Record<string, string> = {
  running: 'Installed, running',
  stop: 'Installed, stopped',
  broken: 'Installed, broken',
  installing: 'Installing',
  upgrading: 'Upgrading',
  uninstalling: 'Uninstalling',
};

// `from`: where the entry comes from, in words.
export function EntryCard({ entry, from, phase, actions }: { entry: ServerEntry; from: string; phase: Phase | undefined; actions: EntryActions }) {
  const { api } = useSession();
  const name = entry.dname || entry.id;
  const headingId = `catalogue-${entry.source}-${entry.id}`;
  return (
    <li class="catalogue-entry" aria-labelledby={headingId}>
      <img class="catalogue-icon" src={entryIconUrl(api, entry)} alt="" width={72} height={72} loading="lazy" />
      <div class="catalogue-text">
        <h3 id={headingId}>{name}</h3>
        <EntryMarks entry={entry} />
        {entry.desc && <p class="catalogue-desc">{entry.desc}</p>}
        <p class="catalogue-from">From {from}</p>
        <PhaseView name={name} phase={phase} actions={actions} />
        <EntryButtons entry={entry} name={name} from={from} phase={phase} actions={actions} />
      </div>
    </li>
  );
}

function EntryMarks({ entry }: { entry: ServerEntry }) {
  return (
    <p class="catalogue-meta">
      <span>Version {entry.version ?? 'unknown'}</span>
      {entry.beta && <span class="badge beta">Beta</span>}
      {entry.blupgrade && <span class="badge upgrade">Upgrade available</span>}
      {isInstalled(entry) && !entry.blupgrade && <span class="badge running">{kInstalledWords[entry.status ?? ''] ?? 'Installed'}</span>}
    </p>
  );
}

// The package's phase: a note, the followed task, or a download waiting for
// its wizard.
function PhaseView({ name, phase, actions }: { name: string; phase: Phase | undefined; actions: EntryActions }) {
  switch (phase?.kind) {
    case 'note':
      return (
        <p class={phase.failed ? 'error' : 'hint'} role={phase.failed ? 'alert' : 'status'}>
          {phase.text}
        </p>
      );
    case 'running':
      return <TaskProgress taskId={phase.taskId} name={name} onEnd={actions.onEnd} />;
    case 'installed':
      return (
        <p class="hint" role="status">
          {phase.text}
        </p>
      );
    case 'starting':
      return <p class="hint">Starting the download of {name}…</p>;
    case 'downloaded':
      return (
        <div class="buttons start">
          <WaitingWatch taskId={phase.taskId} onChanged={actions.onWaitingChanged} />
          <span class="hint">Downloaded, waiting for the install wizard.</span>
          <button type="button" class="primary" onClick={actions.onContinue}>
            Continue install
          </button>
          <button type="button" onClick={actions.onDiscard}>
            Discard download
          </button>
        </div>
      );
    default:
      return null;
  }
}

// Watches a download that waits for its wizard: the install may go on
// from another page (or from this one, reloaded right after its wizard's
// Install), which turns the task into an install, or the file may be
// discarded. Reports the task's data once it no longer waits.
function WaitingWatch({ taskId, onChanged }: { taskId: string; onChanged: (data: TaskData) => void }) {
  const { api } = useSession();
  const load = useCallback(() => taskStatus(api, taskId), [api, taskId]);
  const waiting = (data: TaskData) => data.status === 'downloaded' && !data.blqinst;
  const { result } = usePoll(load, { everyMs: kBusyPollMs, again: (r) => !r.ok || waiting(r.data), waitFirst: true });
  const changed = useRef(onChanged);
  changed.current = onChanged;
  useEffect(() => {
    if (result?.ok && !waiting(result.data)) changed.current(result.data);
  }, [result]);
  return null;
}

// Install or upgrade, and the switch of origin, when no task is under way.
function EntryButtons({ entry, name, from, phase, actions }: { entry: ServerEntry; name: string; from: string; phase: Phase | undefined; actions: EntryActions }) {
  const installed = isInstalled(entry);
  // No install is offered beside the word that it is installed.
  const canInstall = !phase || phase.kind === 'note';
  const originRefused = phase?.kind === 'note' && phase.originRefused === true;
  const canSwitch = canInstall && installed && (entry.other_origin !== undefined || originRefused);
  const verb = entry.blupgrade ? 'Upgrade' : 'Install';
  const act = entry.blupgrade ? actions.onUpgrade : actions.onInstall;
  return (
    <>
      {canSwitch && (
        <div class="buttons start">
          {entry.other_origin && <span class="hint">Installed from {entry.other_origin}, which it is updated from.</span>}
          <button type="button" onClick={actions.onSwitch} aria-label={`Switch ${name} to ${from}`}>
            Switch to this source…
          </button>
        </div>
      )}
      {canInstall && (!installed || entry.blupgrade) && (
        <div class="buttons start">
          <button type="button" class="primary" onClick={act} aria-label={`${verb} ${name}`}>
            {verb}
          </button>
        </div>
      )}
    </>
  );
}
