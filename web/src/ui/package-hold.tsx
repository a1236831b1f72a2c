// A package's hold on automatic updates, on its page: whether automatic
// updates leave it at its version (until a day, or until lifted), setting
// and lifting the hold, and how the last run of automatic updates fared
// with it.

import './package-hold.css';
import { useEffect, useState } from 'preact/hooks';
import type { ApiFailure } from '../api/client';
import { getAutoUpdate, holdPackage, kOutcomeWords, releasePackage, type AutoUpdateState } from '../api/auto-update';
import { useSession } from '../session';
import { ErrorText } from './error-text';
import { whenText } from './kept-version';

// Tomorrow as YYYY-MM-DD in the browser's time: the first day a hold may
// name (the appliance checks it against its own clock).
function tomorrow(): string {
  const d = new Date(Date.now() + 24 * 3600 * 1000);
  const two = (n: number) => String(n).padStart(2, '0');
  return `${d.getFullYear()}-${two(d.getMonth() + 1)}-${two(d.getDate())}`;
}

export function PackageHold({ id, name }: { id: string; name: string }) {
  const { api } = useSession();
  const [state, setState] = useState<AutoUpdateState | null>(null);
  const [failure, setFailure] = useState<ApiFailure | null>(null);
  const [until, setUntil] = useState('');
  const [busy, setBusy] = useState(false);

  useEffect(() => {
    void getAutoUpdate(api).then((answer) => (answer.ok ? setState(answer.data) : setFailure(answer.error)));
  }, [api, id]);

  const act = async (what: 'hold' | 'release', day: string | null) => {
    setBusy(true);
    setFailure(null);
    const answer = what === 'hold' ? await holdPackage(api, id, day) : await releasePackage(api, id);
    setBusy(false);
    if (!answer.ok) return setFailure(answer.error);
    setState(answer.data);
    setUntil('');
  };

  if (!state) return failure ? <ErrorText error={failure} /> : null;
  const hold = state.holds[id];
  const held = hold?.active === true;
  const outcome = state.last_run?.packages[id];
  return (
    <section class="package-hold" aria-labelledby="package-hold-title">
      <h2 id="package-hold-title">Automatic updates</h2>
      <p data-testid="hold-state">
        {held
          ? `${name} is held at its version ${hold.until ? `until ${hold.until} begins` : 'until the hold is lifted'} (set by ${hold.by} on ${whenText(hold.since * 1000)}).`
          : `${name} is not held: automatic updates upgrade it${state.mode === 'off' ? ' once they are on' : ''}.`}
      </p>
      {held ? (
        <button type="button" disabled={busy} onClick={() => void act('release', null)}>
          Lift hold
        </button>
      ) : (
        <>
          <label>
            Hold until <input type="date" min={tomorrow()} value={until} onInput={(e) => setUntil(e.currentTarget.value)} />
          </label>
          <button type="button" disabled={busy || until === ''} onClick={() => void act('hold', until)}>
            Hold until that day
          </button>
          <button type="button" disabled={busy} onClick={() => void act('hold', null)}>
            Hold until lifted
          </button>
        </>
      )}
      {outcome && state.last_run && (
        <p class="hint" data-testid="last-outcome">
          Last run, {whenText(state.last_run.started * 1000)}: {kOutcomeWords[outcome.outcome] ?? outcome.outcome}
          {outcome.outcome === 'upgraded' ? ` ${outcome.from} → ${outcome.to}` : ` (${outcome.words})`}.
        </p>
      )}
      <ErrorText error={failure} />
    </section>
  );
}
