// What the watchdog did to a package, beside its state: "Restarted 2 times
// in the last hour", or that it gave up ("Crashed: stopped trying after 5
// restarts") with the reason, the last lines of the package's log and a
// "Start again" button (the administrator's start clears the mark).
//
// One question serves a whole list: WatchdogViews asks once, and again
// whenever `refresh` changes (the list it sits in was fetched again), and
// every WatchdogNote inside it reads its package from that answer.

import './watchdog-note.css';
import { createContext, type ComponentChildren } from 'preact';
import { useContext, useEffect, useState } from 'preact/hooks';
import type { ApiFailure } from '../api/client';
import { controlPackages } from '../api/control';
import { watchdogViews, type WatchdogView } from '../api/watchdog';
import { useSession } from '../session';
import { ErrorText } from './error-text';

const Views = createContext<Map<string, WatchdogView> | null>(null);

export function WatchdogViews({ refresh, children }: { refresh: unknown; children: ComponentChildren }) {
  const { api } = useSession();
  const [views, setViews] = useState<Map<string, WatchdogView> | null>(null);
  useEffect(() => {
    let current = true;
    void watchdogViews(api).then((answer) => {
      // Without an answer the notes say nothing: the package's state beside
      // them is the list's own.
      if (current) setViews(answer.ok ? answer.data : null);
    });
    return () => {
      current = false;
    };
  }, [api, refresh]);
  return <Views.Provider value={views}>{children}</Views.Provider>;
}

function timesText(n: number): string {
  return n === 1 ? 'once' : `${n} times`;
}

export function WatchdogNote({ id, name, onStarted }: { id: string; name: string; onStarted: () => void }) {
  const view = useContext(Views)?.get(id);
  if (!view) return null;
  if (view.crashed) return <CrashedNote view={view} name={name} onStarted={onStarted} />;
  if (view.restarts_last_hour === 0) return null;
  return <span class="watchdog-restarts hint">Restarted {timesText(view.restarts_last_hour)} in the last hour</span>;
}

function CrashedNote({ view, name, onStarted }: { view: WatchdogView; name: string; onStarted: () => void }) {
  const { api } = useSession();
  const [busy, setBusy] = useState(false);
  const [failure, setFailure] = useState<ApiFailure | null>(null);
  const crashed = view.crashed;
  if (!crashed) return null;
  const start = async () => {
    setBusy(true);
    setFailure(null);
    const answer = await controlPackages(api, 'start', [view.id]);
    setBusy(false);
    if (answer.ok) onStarted();
    else setFailure(answer.error);
  };
  const when = new Date(crashed.time).toLocaleString(undefined, { dateStyle: 'medium', timeStyle: 'short' });
  return (
    <div class="watchdog-crashed" role="group" aria-label={`${name} crashed`}>
      <p>
        <strong>Crashed: stopped trying after {crashed.restarts} restarts</strong> <span class="hint">({when})</span>
      </p>
      <p class="watchdog-reason">The watchdog gave up on {name}: {crashed.reason}.</p>
      {crashed.log !== '' && (
        <details>
          <summary>The last lines of its log</summary>
          <pre class="log">{crashed.log}</pre>
        </details>
      )}
      <button type="button" disabled={busy} onClick={() => void start()}>
        {busy ? 'Starting…' : 'Start again'}
      </button>
      <ErrorText error={failure} />
    </div>
  );
}
