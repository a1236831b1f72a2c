// The catalogue: what the vendor's package server and the added feeds offer,
// with what the appliance knows about each package (installed, upgradable,
// a download or install under way). Recommendations come first, in the
// server's order. Installing goes through a download, the install wizard
// and a quick install, an upgrade through its own dialog
// (catalogue-installs.tsx); the progress shown is the
// appliance's task, so a reloaded page or a second tab finds it again in the
// catalogue's answer and follows it on (catalogue-state.ts).

import './catalogue.css';
import type { JSX } from 'preact';
import { useState } from 'preact/hooks';
import type { ApiFailure } from '../api/client';
import type { ServerEntry } from '../api/server';
import { useSession } from '../session';
import { ErrorText } from '../ui/error-text';
import { EntryCard } from './catalogue-card';
import { InstallDialogs, useInstalls } from './catalogue-installs';
import { FeedSections, VendorState } from './catalogue-sources';
import { entriesOf, sourceOf, useCatalogue, type Catalogue } from './catalogue-state';

function matches(entry: ServerEntry, query: string): boolean {
  const q = query.trim().toLowerCase();
  if (q === '') return true;
  return [entry.dname, entry.id, entry.desc, entry.maintainer].some((text) => text?.toLowerCase().includes(q));
}

// The catalogue's entries under their headings, as the search narrows them.
function sections(catalogue: Catalogue | null, query: string) {
  const vendor = catalogue?.vendor.ok ? catalogue.vendor.data : null;
  const recommended = (vendor?.recommend ?? []).filter((e) => matches(e, query));
  const recommendedIds = new Set((vendor?.recommend ?? []).map((e) => e.id));
  const vendorRest = (vendor?.data ?? []).filter((e) => !recommendedIds.has(e.id) && matches(e, query));
  const fromFeeds = (catalogue?.others?.ok ? catalogue.others.data.data : []).filter((e) => matches(e, query));
  return { recommended, vendorRest, fromFeeds, shown: recommended.length + vendorRest.length + fromFeeds.length };
}

export function CatalogueScreen() {
  const { api } = useSession();
  const state = useCatalogue(api);
  const installs = useInstalls(api, state);
  const [query, setQuery] = useState('');
  const { catalogue } = state;
  const { recommended, vendorRest, fromFeeds, shown } = sections(catalogue, query);
  const upgrades = (catalogue ? entriesOf(catalogue) : []).filter((e) => e.blupgrade).length;
  const from = (entry: ServerEntry) => sourceOf(entry, catalogue);
  // While the upgrade dialog follows a package's tasks, its card does not.
  const phaseOf = (entry: ServerEntry) => (installs.inDialog(entry) ? undefined : state.phases[entry.id]);
  const card = (entry: ServerEntry) => (
    <EntryCard key={`${entry.source}-${entry.id}`} entry={entry} from={from(entry)} phase={phaseOf(entry)} actions={installs.actionsFor(entry)} />
  );
  return (
    <section class="catalogue" aria-labelledby="catalogue-title">
      <CatalogueHead query={query} onQuery={setQuery} loading={state.loading} onRefresh={() => void state.load(true)} />
      {catalogue === null && <p class="loading">Loading the catalogue…</p>}
      {upgrades > 0 && (
        <p class="hint" role="status">
          {upgrades === 1 ? 'One installed package has an upgrade.' : `${upgrades} installed packages have upgrades.`}
        </p>
      )}
      {catalogue !== null && query.trim() !== '' && shown === 0 && <p class="hint">No package matches “{query.trim()}”.</p>}
      {catalogue !== null && catalogue.betasLeftOut > 0 && (
        <p class="hint">
          {catalogue.betasLeftOut === 1 ? 'One beta version is' : `${catalogue.betasLeftOut} beta versions are`} not offered: the update channel is “Stable versions only”.
          Choose the beta channel in Settings to see {catalogue.betasLeftOut === 1 ? 'it' : 'them'}.
        </p>
      )}
      {catalogue && !catalogue.vendor.ok && (
        <Problem error={catalogue.vendor.error}>The vendor's package server sent no catalogue: it may be unreachable or answer something else.</Problem>
      )}
      <VendorState sources={catalogue?.sources} />
      <Section title="Recommended" entries={recommended} card={card} />
      <Section title={recommended.length > 0 ? 'More from the vendor' : 'From the vendor'} entries={vendorRest} card={card} />
      {catalogue && !catalogue.feeds.ok && <Problem error={catalogue.feeds.error}>The list of added feeds could not be read.</Problem>}
      {catalogue?.others && !catalogue.others.ok && (
        <Problem error={catalogue.others.error}>The added feeds sent no catalogue: they may be unreachable or answer something else.</Problem>
      )}
      <FeedSections sources={catalogue?.sources} entries={fromFeeds} card={card} />
      <InstallDialogs installs={installs} sourceOf={from} />
    </section>
  );
}

function CatalogueHead({ query, onQuery, loading, onRefresh }: { query: string; onQuery: (q: string) => void; loading: boolean; onRefresh: () => void }) {
  return (
    <div class="catalogue-head">
      <h1 id="catalogue-title">All packages</h1>
      <div class="catalogue-tools">
        <input type="search" aria-label="Search packages" placeholder="Search packages" value={query} onInput={(e) => onQuery(e.currentTarget.value)} />
        <button type="button" onClick={onRefresh} disabled={loading}>
          {loading ? 'Loading…' : 'Refresh'}
        </button>
      </div>
    </div>
  );
}

// A heading and its entries; nothing when there are none.
function Section({ title, entries, card }: { title: string; entries: ServerEntry[]; card: (entry: ServerEntry) => JSX.Element }) {
  if (entries.length === 0) return null;
  return (
    <>
      <h2>{title}</h2>
      <ul class="catalogue-list">{entries.map(card)}</ul>
    </>
  );
}

// A catalogue that could not be had: what, in words, and the failure.
function Problem({ error, children }: { error: ApiFailure; children: string }) {
  return (
    <div class="catalogue-problem">
      <p>{children}</p>
      <ErrorText error={error} />
    </div>
  );
}
