// The earlier version of a package that its last upgrade kept, on the
// package's page: which version, when it was replaced and the room its copy
// takes, with "Roll back" and "Drop copy"; the rollback's progress and how
// it ended (the rollback runs on the appliance, so a reloaded page picks it
// up where it is); and the version an automatic update failed to install
// and will not try again.

import './kept-version.css';
import type { ComponentChildren } from 'preact';
import { useCallback, useEffect, useRef, useState } from 'preact/hooks';
import type { ApiFailure } from '../api/client';
import { ToolCode } from '../api/codes';
import { messageFor } from '../api/messages';
import { dropKeptVersions, packageRevisions, rollBack, type AutoUpdateFailure, type KeptVersion, type Rollback } from '../api/revision';
import { useSession } from '../session';
import { Dialog } from './dialog';
import { ErrorText } from './error-text';
import { formatBytes } from './install-pages';
import { usePoll } from './poll';
import { ProgressBar } from './progress';

const kPollMs = 1000;

// A time as people read it here: "12 Mar 2025, 14:05".
export function whenText(ms: number): string {
  return new Date(ms).toLocaleString(undefined, { dateStyle: 'medium', timeStyle: 'short' });
}

type Asking = { kind: 'none' } | { kind: 'rollback' } | { kind: 'drop' };

export function KeptVersionPanel({ id, name, onChanged }: { id: string; name: string; onChanged: () => void }) {
  const { api } = useSession();
  const load = useCallback(() => packageRevisions(api, id), [api, id]);
  const { result, reload } = usePoll(load, { everyMs: kPollMs, again: (r) => r.ok && r.data.rollback?.state === 'running' });
  const [asking, setAsking] = useState<Asking>({ kind: 'none' });
  const [failure, setFailure] = useState<ApiFailure | null>(null);
  const [dropped, setDropped] = useState<string | null>(null);
  const [busy, setBusy] = useState(false);
  useRollbackEnd(result?.ok ? result.data.rollback : undefined, onChanged);

  if (result === null || !result.ok) return result === null ? null : <ErrorText error={result.error} />;
  const { kept, rollback, autoupdate_failure: failed, version } = result.data;
  const previous = kept[0] as KeptVersion | undefined;
  const running = rollback?.state === 'running';
  if (!previous && !rollback && !failed && dropped === null) return null;

  const act = async (what: 'rollback' | 'drop') => {
    setAsking({ kind: 'none' });
    setFailure(null);
    setDropped(null);
    setBusy(true);
    const answer = what === 'rollback' ? await rollBack(api, id) : await dropKeptVersions(api, id);
    setBusy(false);
    if (!answer.ok) setFailure(answer.error);
    else if (what === 'drop' && previous) setDropped(`The copy of ${name} ${previous.version} was dropped; ${formatBytes(previous.bytes)} are free again.`);
    await reload();
  };

  return (
    <section class="kept-version" aria-labelledby="kept-version-title">
      <h2 id="kept-version-title">Earlier version</h2>
      {previous ? (
        <p>
          {name} {previous.version} is kept with its data: it was replaced on {whenText(previous.replaced * 1000)}, and its copy takes{' '}
          {formatBytes(previous.bytes)}.
        </p>
      ) : (
        <p class="hint">No earlier version of {name} is kept.</p>
      )}
      {previous && (
        <div class="buttons">
          <button type="button" disabled={running || busy} onClick={() => setAsking({ kind: 'rollback' })}>
            Roll back to {previous.version}
          </button>
          <button type="button" disabled={running || busy} onClick={() => setAsking({ kind: 'drop' })}>
            Drop copy
          </button>
        </div>
      )}
      {rollback && <RollbackState rollback={rollback} name={name} undoable={previous?.version === rollback.from_version} />}
      {dropped && <p role="status">{dropped}</p>}
      <ErrorText error={failure} />
      {failed && <AutoUpdateNote failed={failed} name={name} installed={version} />}
      {asking.kind === 'rollback' && previous && (
        <ConfirmRollback name={name} installed={version} previous={previous} onCancel={() => setAsking({ kind: 'none' })} onConfirm={() => void act('rollback')} />
      )}
      {asking.kind === 'drop' && previous && (
        <ConfirmDrop name={name} installed={version} previous={previous} onCancel={() => setAsking({ kind: 'none' })} onConfirm={() => void act('drop')} />
      )}
    </section>
  );
}

// Calls `onChanged` when a rollback seen running has ended: the package's
// version and state changed with it.
function useRollbackEnd(rollback: Rollback | undefined, onChanged: () => void) {
  const wasRunning = useRef(false);
  const changed = useRef(onChanged);
  changed.current = onChanged;
  const running = rollback?.state === 'running';
  useEffect(() => {
    if (wasRunning.current && !running) changed.current();
    wasRunning.current = running;
  }, [running, rollback?.started]);
}

// `undoable`: the version rolled back from is still the kept one.
function RollbackState({ rollback, name, undoable }: { rollback: Rollback; name: string; undoable: boolean }) {
  const { from_version: from, to_version: to } = rollback;
  if (rollback.state === 'running') {
    return (
      <div class="rollback-progress">
        <ProgressBar label={`Rolling back ${name} from ${from} to ${to}`} value={null} />
        <p class="hint">The rollback goes on when this page is closed.</p>
      </div>
    );
  }
  const ended = rollback.ended ? ` on ${whenText(rollback.ended)}` : '';
  if (rollback.state === 'success') {
    return (
      <p role="status" class="rollback-done">
        {name} was rolled back from {from} to {to}
        {ended}.{undoable ? ` ${from} and the data it wrote are kept: roll back again to undo it.` : ''}
      </p>
    );
  }
  return (
    <div role="alert" class="rollback-failed">
      <p class="error">
        The rollback of {name} from {from} to {to} did not complete{ended}.{' '}
        {rollback.code !== undefined ? messageFor({ code: rollback.code }) : ''}
      </p>
      {rollback.message && <pre class="log">{rollback.message}</pre>}
    </div>
  );
}

function AutoUpdateNote({ failed, name, installed }: { failed: AutoUpdateFailure; name: string; installed: string }) {
  const restored = failed.code === ToolCode.UpgradeRolledBack ? `, and ${installed} was put back` : '';
  return (
    <p class="autoupdate-failed" role="note">
      An automatic update to {name} {failed.version} failed on {whenText(failed.time * 1000)} ({failed.reason}){restored}. Automatic updates will not try{' '}
      {failed.version} again; they wait for a newer version.
    </p>
  );
}

// The confirmation of one of the actions on the kept version: what it does
// in words, then Cancel before the action.
function Confirm({ title, action, onCancel, onConfirm, children }: { title: string; action: string; onCancel: () => void; onConfirm: () => void; children: ComponentChildren }) {
  return (
    <Dialog title={title} onClose={onCancel}>
      {children}
      <div class="buttons">
        <button type="button" onClick={onCancel}>
          Cancel
        </button>
        <button type="button" class="primary" onClick={onConfirm}>
          {action}
        </button>
      </div>
    </Dialog>
  );
}

interface ConfirmProps {
  name: string;
  installed: string;
  previous: KeptVersion;
  onCancel: () => void;
  onConfirm: () => void;
}

function ConfirmRollback({ name, installed, previous, onCancel, onConfirm }: ConfirmProps) {
  return (
    <Confirm title={`Roll back ${name} to ${previous.version}?`} action="Roll back" onCancel={onCancel} onConfirm={onConfirm}>
      <p>
        {name} {installed} will be replaced by {previous.version}, with the data as it was when {previous.version} was replaced on{' '}
        {whenText(previous.replaced * 1000)}. {name} is stopped for the rollback and started again if it runs now.
      </p>
      <p>
        The data {installed} has written is not lost: it is kept with {installed}, so you can undo the rollback by rolling back again.
      </p>
    </Confirm>
  );
}

function ConfirmDrop({ name, installed, previous, onCancel, onConfirm }: ConfirmProps) {
  return (
    <Confirm title={`Drop the copy of ${name} ${previous.version}?`} action="Drop copy" onCancel={onCancel} onConfirm={onConfirm}>
      <p>
        {previous.version} and the copy of its data are removed, which frees {formatBytes(previous.bytes)}. {name} can then no longer be rolled
        back to {previous.version}. {name} {installed} and its data stay as they are.
      </p>
    </Confirm>
  );
}
