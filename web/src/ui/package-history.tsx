// A package's own history in its details: the latest entries of the
// activity log that name it (installs, upgrades, starts, stops, removals,
// whoever made them and however they ended), with a link to the whole of it
// on the Activity screen.

import { useCallback } from 'preact/hooks';
import { listActivity } from '../api/activity';
import { routeHref } from '../route';
import { useSession } from '../session';
import { ActivityTable } from './activity-entries';
import { ErrorText } from './error-text';
import { usePoll } from './poll';

const kShown = 10;
const kRunningPollMs = 3000;

// `changed` changes whenever the details see the package change (an action
// done from them), so that the history shows it.
export function PackageHistory({ id, changed }: { id: string; changed?: unknown }) {
  const { api } = useSession();
  const load = useCallback(() => listActivity(api, { package: id }, 0, kShown), [api, id, changed]);
  const { result } = usePoll(load, {
    everyMs: kRunningPollMs,
    again: (r) => r.ok && r.data.entries.some((e) => e.state === 'running'),
  });
  return (
    <section aria-labelledby="history-title" class="package-history">
      <h2 id="history-title">History</h2>
      {result === null && <p class="hint">Loading its history…</p>}
      {result !== null && !result.ok && <ErrorText error={result.error} />}
      {result?.ok && result.data.entries.length === 0 && <p class="hint">Nothing is on record for this package.</p>}
      {result?.ok && result.data.entries.length > 0 && (
        <>
          <ActivityTable entries={result.data.entries} caption={`History of ${id}, newest first`} withPackages={false} />
          {result.data.total > result.data.entries.length && (
            <p>
              <a href={routeHref({ screen: 'activity', id })}>All {result.data.total} entries on the Activity screen</a>
            </p>
          )}
        </>
      )}
    </section>
  );
}
