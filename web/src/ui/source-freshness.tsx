// How fresh one source of the catalogue is (the vendor's package server or
// an added feed), shown beside that source's packages: when its catalogue
// was last fetched, and when its fetches fail, since when and why, loudly.
// A failing source is never shown as one that simply lists nothing.

import './source-freshness.css';
import type { SourceStatus } from '../api/sources';

// "3 minutes ago", told against the appliance's clock (`now`).
export function ago(then: number, now: number): string {
  const s = Math.max(0, now - then);
  if (s < 60) return 'just now';
  const [n, unit] = s < 3600 ? [Math.floor(s / 60), 'minute'] : s < 86400 ? [Math.floor(s / 3600), 'hour'] : [Math.floor(s / 86400), 'day'];
  return `${n} ${unit}${n === 1 ? '' : 's'} ago`;
}

// A time of the appliance's record, in the browser's local words.
export function when(then: number): string {
  return new Date(then * 1000).toLocaleString();
}

function packagesWords(n: number | null): string {
  if (n === null) return '';
  return n === 1 ? ' It lists one package.' : ` It lists ${n} packages.`;
}

// `label`: the source in words ("the vendor's server", "the feed Our feed").
export function SourceFreshness({ source, now, label }: { source: SourceStatus | undefined; now: number; label: string }) {
  if (!source) return null;
  switch (source.state) {
    case 'unconfigured':
      return <p class="source-state source-unknown">No vendor package server is configured on this appliance.</p>;
    case 'unknown':
      return <p class="source-state source-unknown">The catalogue of {label} has not been fetched yet.</p>;
    case 'ok':
      if (source.packages === 0) {
        return (
          <p class="source-state source-empty" role="status">
            {capitalised(label)} answers, but its catalogue lists no packages (fetched {ago(source.last_success ?? now, now)}).
          </p>
        );
      }
      return (
        <p class="source-state source-ok">
          Fetched {ago(source.last_success ?? now, now)} ({when(source.last_success ?? now)}).{packagesWords(source.packages)}
        </p>
      );
    case 'failing':
      return (
        <div class="source-state source-failing" role="alert">
          <p>
            <strong>{capitalised(label)} is failing</strong>
            {source.failing_since !== null ? ` since ${when(source.failing_since)} (${ago(source.failing_since, now)})` : ''}: {source.error || 'no reason was recorded'}.
          </p>
          <p>
            {source.last_success !== null
              ? `Its catalogue was last fetched successfully ${ago(source.last_success, now)} (${when(source.last_success)}).`
              : 'Its catalogue has never been fetched successfully.'}{' '}
            Its packages cannot be shown until it answers again; Refresh asks it again.
          </p>
        </div>
      );
  }
}

function capitalised(text: string): string {
  return text.charAt(0).toUpperCase() + text.slice(1);
}
