import './activity.css';
import { useCallback, useState } from 'preact/hooks';
import { exportActivity, listActivity, type ActivityFilter, type ActivityState, type ExportFormat } from '../api/activity';
import type { ApiFailure } from '../api/client';
import { useSession } from '../session';
import { ActivityTable, kOperations, kOutcomes } from '../ui/activity-entries';
import { ErrorText } from '../ui/error-text';
import { Field, TextField } from '../ui/form';
import { usePoll } from '../ui/poll';

// The activity log (docs/activity.md): who changed what on the appliance,
// when, from where and how it ended, newest first, a page at a time, with
// filters, and exported as CSV or JSON with the same filters.

const kPageSize = 50;
// While an entry is under way, the page asks again this often.
const kRunningPollMs = 3000;

// The form as typed: the time range in the browser's local time, as
// <input type="datetime-local"> gives it.
interface Draft {
  package: string;
  account: string;
  operation: string;
  outcome: '' | ActivityState;
  from: string;
  to: string;
}

const kEmptyDraft: Draft = { package: '', account: '', operation: '', outcome: '', from: '', to: '' };

// The filter a draft asks for, or the words of what is wrong with it.
function filterOf(d: Draft): { filter: ActivityFilter } | { problem: string } {
  const time = (text: string) => (text === '' ? undefined : new Date(text).getTime());
  const since = time(d.from);
  // "To" names a minute: the whole of it is in the range.
  const to = time(d.to);
  const until = to === undefined ? undefined : to + 59_999;
  if (Number.isNaN(since) || Number.isNaN(until)) return { problem: 'A time of the range is not a date and time.' };
  if (since !== undefined && until !== undefined && since > until) return { problem: '“From” is after “To”.' };
  return {
    filter: {
      package: d.package.trim(),
      account: d.account.trim(),
      operation: d.operation,
      outcome: d.outcome === '' ? undefined : d.outcome,
      since,
      until,
    },
  };
}

function saveFile(blob: Blob, name: string) {
  const url = URL.createObjectURL(blob);
  const link = document.createElement('a');
  link.href = url;
  link.download = name;
  document.body.append(link);
  link.click();
  link.remove();
  setTimeout(() => URL.revokeObjectURL(url), 10_000);
}

function FilterForm({ initial, onApply }: { initial: Draft; onApply: (draft: Draft) => void }) {
  const [draft, setDraft] = useState(initial);
  const set = (change: Partial<Draft>) => setDraft((d) => ({ ...d, ...change }));
  return (
    <form
      class="card activity-filters"
      aria-label="Filters"
      onSubmit={(e) => {
        e.preventDefault();
        onApply(draft);
      }}
    >
      <TextField id="activity-package" label="Package" value={draft.package} onValue={(v) => set({ package: v })} placeholder="a package id" />
      <TextField id="activity-account" label="Account" value={draft.account} onValue={(v) => set({ account: v })} placeholder="any" />
      <Field id="activity-operation" label="Operation">
        <select id="activity-operation" value={draft.operation} onChange={(e) => set({ operation: e.currentTarget.value })}>
          <option value="">Any</option>
          {kOperations.map((o) => (
            <option key={o.name} value={o.name}>
              {o.words}
            </option>
          ))}
        </select>
      </Field>
      <Field id="activity-outcome" label="Outcome">
        <select id="activity-outcome" value={draft.outcome} onChange={(e) => set({ outcome: e.currentTarget.value as Draft['outcome'] })}>
          <option value="">Any</option>
          {kOutcomes.map((o) => (
            <option key={o.state} value={o.state}>
              {o.words}
            </option>
          ))}
        </select>
      </Field>
      <TextField id="activity-from" label="From" type="datetime-local" value={draft.from} onValue={(v) => set({ from: v })} />
      <TextField id="activity-to" label="To" type="datetime-local" value={draft.to} onValue={(v) => set({ to: v })} />
      <div class="buttons">
        <button
          type="button"
          onClick={() => {
            setDraft(kEmptyDraft);
            onApply(kEmptyDraft);
          }}
        >
          Clear
        </button>
        <button type="submit" class="primary">
          Apply filters
        </button>
      </div>
    </form>
  );
}

function ExportButtons({ filter }: { filter: ActivityFilter }) {
  const { api } = useSession();
  const [busy, setBusy] = useState(false);
  const [error, setError] = useState<ApiFailure | null>(null);
  const save = async (format: ExportFormat) => {
    setBusy(true);
    setError(null);
    const result = await exportActivity(api, filter, format);
    setBusy(false);
    if (result.ok) saveFile(result.data, `activity.${format}`);
    else setError(result.error);
  };
  return (
    <div class="activity-export">
      <button type="button" disabled={busy} onClick={() => void save('csv')}>
        Export CSV
      </button>
      <button type="button" disabled={busy} onClick={() => void save('json')}>
        Export JSON
      </button>
      <ErrorText error={error} />
    </div>
  );
}

function Pager({ offset, shown, total, onOffset }: { offset: number; shown: number; total: number; onOffset: (offset: number) => void }) {
  return (
    <nav class="activity-pager" aria-label="Pages">
      <button type="button" disabled={offset === 0} onClick={() => onOffset(Math.max(0, offset - kPageSize))}>
        ← Newer
      </button>
      <span role="status">{shown === 0 ? `None of ${total}` : `${offset + 1}–${offset + shown} of ${total}`}</span>
      <button type="button" disabled={offset + shown >= total} onClick={() => onOffset(offset + kPageSize)}>
        Older →
      </button>
    </nav>
  );
}

// `packageId`: the package whose history to show first (from a package's
// details), "" for all.
export function ActivityScreen({ packageId = '' }: { packageId?: string }) {
  const { api } = useSession();
  const initial = { ...kEmptyDraft, package: packageId };
  const [filter, setFilter] = useState<ActivityFilter>({ package: packageId });
  const [problem, setProblem] = useState('');
  const [offset, setOffset] = useState(0);
  const load = useCallback(() => listActivity(api, filter, offset, kPageSize), [api, filter, offset]);
  const { result } = usePoll(load, {
    everyMs: kRunningPollMs,
    again: (r) => r.ok && r.data.entries.some((e) => e.state === 'running'),
  });
  const apply = (draft: Draft) => {
    const made = filterOf(draft);
    if ('problem' in made) return setProblem(made.problem);
    setProblem('');
    setOffset(0);
    setFilter(made.filter);
  };
  return (
    <section class="activity" aria-labelledby="activity-title">
      <div class="activity-head">
        <h1 id="activity-title">Activity</h1>
        <ExportButtons filter={filter} />
      </div>
      <p class="hint">Who changed what on this appliance, when, from where, and how it ended. Newest first.</p>
      <FilterForm key={packageId} initial={initial} onApply={apply} />
      {problem && (
        <p class="error" role="alert">
          {problem}
        </p>
      )}
      {result === null && <p class="hint">Loading the activity…</p>}
      {result !== null && !result.ok && <ErrorText error={result.error} />}
      {result?.ok && (
        <>
          {result.data.entries.length === 0 ? (
            <p>{result.data.total === 0 ? 'Nothing matches these filters.' : 'No entries on this page.'}</p>
          ) : (
            <ActivityTable entries={result.data.entries} caption="Activity, newest first" withPackages />
          )}
          <Pager offset={offset} shown={result.data.entries.length} total={result.data.total} onOffset={setOffset} />
        </>
      )}
    </section>
  );
}
