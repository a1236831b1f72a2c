// The activity log's entries in words (docs/activity.md): the table the
// Activity screen and a package's history both show, and the names of the
// operations the log records.

import './listing.css';
import './activity-entries.css';
import { Fragment } from 'preact';
import type { ActivityEntry, ActivityState } from '../api/activity';
import { routeHref } from '../route';

// The operations the log records, in the words the page uses; the filter
// offers them in this order. An operation the page does not know (a newer
// appliance's) is shown by its name.
export const kOperations: { name: string; words: string }[] = [
  { name: 'Installation.install', words: 'Install or upgrade' },
  { name: 'Uninstallation.uninstall', words: 'Uninstall' },
  { name: 'Control.start', words: 'Start' },
  { name: 'Control.stop', words: 'Stop' },
  { name: 'Revision.rollback', words: 'Roll back' },
  { name: 'Revision.drop', words: 'Drop a kept version' },
  { name: 'Installation.cancel', words: 'Cancel a download' },
  { name: 'Installation.clean', words: 'Clean up an upload' },
  { name: 'Installation.delete', words: 'Delete a download' },
  { name: 'Setting.set', words: 'Change settings' },
  { name: 'Setting.Volume.set', words: 'Set the default volume' },
  { name: 'Setting.Update.add', words: 'Turn on automatic updates' },
  { name: 'Setting.Update.delete', words: 'Turn off automatic updates' },
  { name: 'Feed.add', words: 'Add a feed' },
  { name: 'Feed.set', words: 'Rename a feed' },
  { name: 'Feed.delete', words: 'Delete a feed' },
  { name: 'Feed.Keyring.add', words: 'Import a signing key' },
  { name: 'Feed.Keyring.delete', words: 'Delete a signing key' },
  { name: 'UserSettings.set', words: 'Agree to the terms' },
  { name: 'AutoUpdate.set', words: 'Set the update window' },
  { name: 'AutoUpdate.hold', words: 'Hold a package back' },
  { name: 'AutoUpdate.release', words: 'Lift a hold' },
  { name: 'auto-update', words: 'Automatic updates run' },
  { name: 'restart', words: 'Restarted by the watchdog' },
  { name: 'give-up', words: 'Watchdog gave up' },
  { name: 'sign-in', words: 'Sign in' },
  { name: 'sign-in failed', words: 'Failed sign-in' },
];

export function operationWords(name: string): string {
  return kOperations.find((o) => o.name === name)?.words ?? name;
}

export const kOutcomes: { state: ActivityState; words: string; tone: string }[] = [
  { state: 'success', words: 'Succeeded', tone: 'running' },
  { state: 'failure', words: 'Failed', tone: 'broken' },
  { state: 'unfinished', words: 'Did not finish', tone: 'broken' },
  { state: 'running', words: 'Under way', tone: 'busy' },
];

function Outcome({ entry }: { entry: ActivityEntry }) {
  const outcome = kOutcomes.find((o) => o.state === entry.state);
  const detail =
    entry.state === 'unfinished'
      ? 'Its process ended before the operation did (it was killed, or crashed).'
      : entry.state === 'failure'
        ? [entry.words, entry.code !== null ? `(code ${entry.code})` : ''].filter(Boolean).join(' ')
        : '';
  return (
    <>
      <span class={`badge ${outcome?.tone ?? 'broken'}`}>{outcome?.words ?? entry.state}</span>
      {detail && <span class="activity-detail">{detail}</span>}
    </>
  );
}

// Where an operation came from, besides the web.
const kOrigins: Record<string, string> = {
  kivoctl: 'command line',
  'auto-update': 'automatic updates',
  watchdog: 'watchdog',
};

function Who({ entry }: { entry: ActivityEntry }) {
  const from =
    entry.origin === 'web'
      ? entry.address
        ? `web, from ${entry.address}`
        : 'web'
      : (kOrigins[entry.origin] ?? entry.origin);
  return (
    <>
      {entry.actor || '—'}
      <span class="activity-detail">{from}</span>
    </>
  );
}

// What the operation named besides its packages: versions, a file, a feed,
// a setting's values. Values are the appliance's record, shown as text.
function targetWords(entry: ActivityEntry): string {
  const t = entry.target;
  const text = (v: unknown) => (typeof v === 'string' ? v : JSON.stringify(v));
  const parts: string[] = [];
  if (t.from_version !== undefined && t.version !== undefined) parts.push(`${text(t.from_version)} → ${text(t.version)}`);
  for (const [key, value] of Object.entries(t)) {
    if (['id', 'name', 'packages', 'from_version'].includes(key)) continue;
    if (key === 'version' && t.from_version !== undefined) continue;
    parts.push(`${key} ${text(value)}`);
  }
  const words = parts.join(', ');
  return words.length > 160 ? `${words.slice(0, 160)}…` : words;
}

function What({ entry, withPackages }: { entry: ActivityEntry; withPackages: boolean }) {
  const target = targetWords(entry);
  return (
    <>
      {operationWords(entry.operation)}
      {withPackages && entry.packages.length > 0 && (
        <span class="activity-detail">
          {entry.packages.map((id, i) => (
            <Fragment key={id}>
              {i > 0 && ', '}
              <a href={routeHref({ screen: 'package', id })}>{id}</a>
            </Fragment>
          ))}
        </span>
      )}
      {target && <span class="activity-detail activity-target">{target}</span>}
    </>
  );
}

export function durationWords(ms: number | null): string {
  if (ms === null) return '—';
  if (ms < 1000) return `${ms} ms`;
  const seconds = Math.round(ms / 100) / 10;
  if (seconds < 60) return `${seconds} s`;
  const whole = Math.round(seconds);
  return `${Math.floor(whole / 60)} min ${whole % 60} s`;
}

// `entries` newest first; `withPackages` adds each entry's packages (left
// out where all are one package's).
export function ActivityTable({ entries, caption, withPackages }: { entries: ActivityEntry[]; caption: string; withPackages: boolean }) {
  return (
    <table class="listing-table activity-table">
      <caption class="visually-hidden">{caption}</caption>
      <thead>
        <tr>
          <th scope="col">When</th>
          <th scope="col">Who</th>
          <th scope="col">What</th>
          <th scope="col">Outcome</th>
          <th scope="col">Took</th>
        </tr>
      </thead>
      <tbody>
        {entries.map((e) => (
          <tr key={e.id} data-state={e.state}>
            <td>
              <time dateTime={new Date(e.started).toISOString()}>{new Date(e.started).toLocaleString()}</time>
            </td>
            <td>
              <Who entry={e} />
            </td>
            <td>
              <What entry={e} withPackages={withPackages} />
            </td>
            <td>
              <Outcome entry={e} />
            </td>
            <td>{durationWords(e.duration_ms)}</td>
          </tr>
        ))}
      </tbody>
    </table>
  );
}
