// The settings' section on when automatic updates run: the maintenance
// window (days and hours in the appliance's local time, or any time) with
// its random delay, when updates ran last and how each package fared, and
// when they may run next.

import './update-window.css';
import { useEffect, useState } from 'preact/hooks';
import type { ApiFailure } from '../api/client';
import { getAutoUpdate, kOutcomeWords, kWeekdays, setUpdateWindow, type AutoUpdateState, type UpdateWindow, type Weekday } from '../api/auto-update';
import { useSession } from '../session';
import { ErrorText } from './error-text';
import { FormButtons } from './form';
import { whenText } from './kept-version';

// What the form starts from when no window is stored yet: nights.
const kDefaultWindow: UpdateWindow = { limited: false, days: [], start: '02:00', end: '05:00', random_delay_minutes: 30 };

function withDefaults(stored: UpdateWindow): UpdateWindow {
  return stored.limited ? stored : { ...kDefaultWindow, random_delay_minutes: stored.random_delay_minutes };
}

export function UpdateWindowSection() {
  const { api } = useSession();
  const [state, setState] = useState<AutoUpdateState | null>(null);
  const [form, setForm] = useState<UpdateWindow | null>(null);
  const [loadError, setLoadError] = useState<ApiFailure | null>(null);
  const [saveError, setSaveError] = useState<ApiFailure | null>(null);
  const [saved, setSaved] = useState(false);
  const [busy, setBusy] = useState(false);

  const show = (s: AutoUpdateState) => {
    setState(s);
    setForm(withDefaults(s.window));
  };
  const load = async () => {
    const answer = await getAutoUpdate(api);
    if (!answer.ok) return setLoadError(answer.error);
    setLoadError(null);
    show(answer.data);
  };
  useEffect(() => {
    void load();
  }, [api]);

  const change = (part: Partial<UpdateWindow>) => {
    setSaved(false);
    setForm((f) => (f ? { ...f, ...part } : f));
  };
  const toggleDay = (day: Weekday, on: boolean) => {
    if (!form) return;
    const days = on ? [...form.days, day] : form.days.filter((d) => d !== day);
    change({ days: kWeekdays.map((w) => w.day).filter((d) => days.includes(d)) });
  };
  const save = async (e: Event) => {
    e.preventDefault();
    if (!form) return;
    setBusy(true);
    setSaved(false);
    const answer = await setUpdateWindow(api, form);
    setBusy(false);
    if (!answer.ok) return setSaveError(answer.error);
    setSaveError(null);
    setSaved(true);
    show(answer.data);
  };

  return (
    <section class="card settings-card update-window" id="update-window" aria-labelledby="update-window-title">
      <h2 id="update-window-title">When automatic updates run</h2>
      {loadError && (
        <div>
          <p>The schedule of automatic updates could not be read.</p>
          <ErrorText error={loadError} />
          <button type="button" onClick={() => void load()}>
            Try again
          </button>
        </div>
      )}
      {!state && !loadError && <p class="hint">Loading…</p>}
      {state && form && (
        <>
          <RunSummary state={state} />
          <form onSubmit={save}>
            <fieldset>
              <legend>Maintenance window (this appliance's local time)</legend>
              <label class="choice">
                <input type="radio" name="window" checked={!form.limited} onChange={() => change({ limited: false })} />
                Any time the scheduler starts them
              </label>
              <label class="choice">
                <input type="radio" name="window" checked={form.limited} onChange={() => change({ limited: true })} />
                Only on these days, between these hours
              </label>
              {form.limited && (
                <div class="window-times">
                  <div class="window-days" role="group" aria-label="Days">
                    {kWeekdays.map((w) => (
                      <label class="choice" key={w.day}>
                        <input type="checkbox" checked={form.days.includes(w.day)} onChange={(e) => toggleDay(w.day, e.currentTarget.checked)} />
                        {w.label}
                      </label>
                    ))}
                  </div>
                  <label>
                    From <input type="time" value={form.start} required onInput={(e) => change({ start: e.currentTarget.value })} />
                  </label>
                  <label>
                    to <input type="time" value={form.end === '24:00' ? '00:00' : form.end} required onInput={(e) => change({ end: endValue(e.currentTarget.value) })} />
                  </label>
                  <p class="hint">An end at or before the start runs past midnight into the next day.</p>
                </div>
              )}
            </fieldset>
            <label class="delay">
              Wait a random delay of up to{' '}
              <input
                type="number"
                min={0}
                max={720}
                value={form.random_delay_minutes}
                onInput={(e) => change({ random_delay_minutes: Number(e.currentTarget.value) })}
              />{' '}
              minutes before asking the package server
            </label>
            <p class="hint">So that many appliances do not all ask at the same second. The delay always ends before the window closes.</p>
            <ErrorText error={saveError} />
            {saved && (
              <p class="saved" role="status">
                Maintenance window saved.
              </p>
            )}
            <FormButtons label="Save window" busy={busy} />
          </form>
        </>
      )}
    </section>
  );
}

// "00:00" as an end is the end of the day.
function endValue(value: string): string {
  return value === '00:00' ? '24:00' : value;
}

function RunSummary({ state }: { state: AutoUpdateState }) {
  const { last_run: last, next_run: next } = state;
  const outcomes = last ? Object.entries(last.packages) : [];
  return (
    <div class="run-summary">
      {state.mode === 'off' && <p class="warning">Automatic updates are off (Preferences, above): nothing runs until they are on.</p>}
      {state.window_error && (
        <p class="warning" role="alert">
          The stored window is not valid ({state.window_error.key}: {state.window_error.reason}); automatic updates do nothing until it is saved again.
        </p>
      )}
      <dl class="run-facts">
        <dt>Last run</dt>
        <dd data-testid="last-run">{last ? `${whenText(last.started * 1000)}${last.exit_status === 0 ? '' : ' (with failures)'}` : 'Never'}</dd>
        <dt>Next run</dt>
        <dd data-testid="next-run">
          {next
            ? state.inside && !state.already_ran
              ? `Now: the window is open until ${whenText(next.closes * 1000)}`
              : `${whenText(next.opens * 1000)} to ${whenText(next.closes * 1000)}`
            : state.window.limited
              ? 'Not scheduled'
              : 'Whenever the scheduler starts them'}
        </dd>
      </dl>
      {outcomes.length > 0 && (
        <table class="run-outcomes">
          <caption>Each package in the last run</caption>
          <thead>
            <tr>
              <th scope="col">Package</th>
              <th scope="col">Outcome</th>
              <th scope="col">Details</th>
            </tr>
          </thead>
          <tbody>
            {outcomes.map(([id, o]) => (
              <tr key={id} data-outcome={o.outcome}>
                <td>{id}</td>
                <td>{kOutcomeWords[o.outcome] ?? o.outcome}</td>
                <td>{o.words}</td>
              </tr>
            ))}
          </tbody>
        </table>
      )}
    </div>
  );
}
