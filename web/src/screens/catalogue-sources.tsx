// The catalogue's sources beside their packages: the vendor's server's state
// above its packages, and each added feed under a heading of its own with its
// state and the packages it lists. A feed that fails keeps its heading and
// says why, since when, and when it last answered; one that answers but
// lists nothing says so. When the record of the fetches cannot be read, the
// feeds' packages are shown together, with that failure.

import type { JSX } from 'preact';
import type { ServerEntry } from '../api/server';
import type { SourceStatus, SourcesAnswer } from '../api/sources';
import type { Result } from '../api/client';
import { ErrorText } from '../ui/error-text';
import { SourceFreshness } from '../ui/source-freshness';

type Card = (entry: ServerEntry) => JSX.Element;

export function VendorState({ sources }: { sources: Result<SourcesAnswer> | undefined }) {
  if (!sources) return null;
  if (!sources.ok) {
    return (
      <div class="source-state">
        <p class="hint">How fresh the catalogue is could not be read:</p>
        <ErrorText error={sources.error} />
      </div>
    );
  }
  const vendor = sources.data.sources.find((s) => s.kind === 'vendor');
  return <SourceFreshness source={vendor} now={sources.data.now} label="the vendor's server" />;
}

function feedLabel(source: SourceStatus): string {
  return `the feed ${source.name || source.url}`;
}

// `entries`: the feeds' entries the search leaves.
export function FeedSections({ sources, entries, card }: { sources: Result<SourcesAnswer> | undefined; entries: ServerEntry[]; card: Card }) {
  if (!sources?.ok) return <Listed title="From added feeds" entries={entries} card={card} />;
  const feeds = sources.data.sources.filter((s) => s.kind === 'feed');
  const known = new Set(feeds.map((s) => s.url));
  // Entries of a feed the record does not name (the list changed between
  // the two answers) are still shown.
  const rest = entries.filter((e) => !e.feed || !known.has(e.feed));
  return (
    <>
      {feeds.map((source) => (
        <section key={source.url} class="feed-source" aria-label={`From ${feedLabel(source)}`}>
          <h2>From {feedLabel(source)}</h2>
          <SourceFreshness source={source} now={sources.data.now} label={feedLabel(source)} />
          <List entries={entries.filter((e) => e.feed === source.url)} card={card} />
        </section>
      ))}
      <Listed title="From other feeds" entries={rest} card={card} />
    </>
  );
}

function List({ entries, card }: { entries: ServerEntry[]; card: Card }) {
  if (entries.length === 0) return null;
  return <ul class="catalogue-list">{entries.map(card)}</ul>;
}

function Listed({ title, entries, card }: { title: string; entries: ServerEntry[]; card: Card }) {
  if (entries.length === 0) return null;
  return (
    <>
      <h2>{title}</h2>
      <List entries={entries} card={card} />
    </>
  );
}
