// What the catalogue screen knows: the catalogues of the vendor's server and
// of the added feeds, and per package what the page shows besides its
// description (a task under way, a download waiting for its wizard, a note).
// The tasks live on the appliance: each load reads them from the
// catalogue's answer again, so a reloaded page or a second tab finds them.

import { useCallback, useEffect, useRef, useState } from 'preact/hooks';
import type { Api, Result } from '../api/client';
import { listFeeds, type Feed } from '../api/feed';
import { downloadTaskId } from '../api/installation';
import { listCatalogue, type ServerEntry, type ServerList } from '../api/server';
import { getSettings } from '../api/setting';
import { listSources, type SourcesAnswer } from '../api/sources';
import { taskFailure } from '../ui/task-progress';

export interface Catalogue {
  vendor: Result<ServerList>;
  feeds: Result<{ items: Feed[] }>;
  // null when no feed is added: there is nothing to ask then.
  others: Result<ServerList> | null;
  // How many beta versions the stable channel left out (offeredOnChannel).
  betasLeftOut: number;
  // How fresh each source is, read after the catalogues were fetched.
  sources: Result<SourcesAnswer>;
}

// What the page shows for one package besides its description: a download
// being asked for, a task under way, a download waiting for its wizard, a
// note on how the last attempt ended, or the word that an install is done
// (`since`: the load after which the catalogue says it is installed).
export type Phase =
  | { kind: 'starting' }
  | { kind: 'running'; taskId: string }
  | { kind: 'downloaded'; taskId: string }
  | { kind: 'note'; text: string; failed: boolean; originRefused?: boolean }
  | { kind: 'installed'; text: string; since: number };

export type Phases = Record<string, Phase>;

const kBusyStatus = new Set(['downloading', 'installing', 'upgrading']);

// A beta version is offered only on the beta channel. A static catalogue
// lists its beta entries whatever channel the query names, so the page
// judges: on the stable channel a beta entry of a package that is not
// installed is left out, and a beta version is no upgrade for one that is.
// When the settings cannot be read (null), everything is offered, beta
// entries marked as always.
export function offeredOnChannel(entry: ServerEntry, betaChannel: boolean | null): ServerEntry | null {
  if (!entry.beta || betaChannel !== false) return entry;
  if (!isInstalled(entry)) return null;
  return entry.blupgrade ? { ...entry, blupgrade: false } : entry;
}

// `list` with what the channel does not offer left out; `left` counts it.
function onChannel(list: Result<ServerList>, betaChannel: boolean | null, left: { count: number }): Result<ServerList> {
  if (!list.ok) return list;
  const keep = (entries: ServerEntry[]) =>
    entries.flatMap((entry) => {
      const offered = offeredOnChannel(entry, betaChannel);
      return offered ? [offered] : [];
    });
  const data = keep(list.data.data);
  left.count += list.data.data.length - data.length;
  const recommend = list.data.recommend && keep(list.data.recommend);
  return { ok: true, data: { ...list.data, data, recommend } };
}

async function loadCatalogue(api: Api, reload: boolean): Promise<Catalogue> {
  const [vendor, feeds, settings] = await Promise.all([listCatalogue(api, { reload }), listFeeds(api), getSettings(api)]);
  const anyFeed = !feeds.ok || feeds.data.items.length > 0;
  const others = anyFeed ? await listCatalogue(api, { reload, others: true }) : null;
  // Asked once the fetches above are done, so that it tells their outcome.
  const sources = await listSources(api);
  const betaChannel = settings.ok ? settings.data.update_channel : null;
  const left = { count: 0 };
  return {
    vendor: onChannel(vendor, betaChannel, left),
    feeds,
    others: others && onChannel(others, betaChannel, left),
    betasLeftOut: left.count,
    sources,
  };
}

// The task a catalogue entry reports, as the page follows it.
function phaseOf(entry: ServerEntry): Phase | null {
  const info = entry.info;
  const taskId = info?.taskid ?? downloadTaskId(entry.id);
  if (info) {
    const failed = taskFailure(info);
    if (failed !== null) return { kind: 'note', text: failed, failed: true };
    if (info.status === 'downloaded' && !info.blqinst) return { kind: 'downloaded', taskId };
    if (info.status === 'downloaded' || kBusyStatus.has(info.status ?? '')) return { kind: 'running', taskId };
  }
  if (entry.status === 'installing' || entry.status === 'upgrading') return { kind: 'running', taskId };
  return null;
}

export function entriesOf(catalogue: Catalogue): ServerEntry[] {
  return [...(catalogue.vendor.ok ? catalogue.vendor.data.data : []), ...(catalogue.others?.ok ? catalogue.others.data.data : [])];
}

export function isInstalled(entry: ServerEntry): boolean {
  return entry.status !== undefined && entry.status !== 'non_installed';
}

// The tasks the appliance reports win; the page's own notes stay until the
// package has a task again. A download the page follows stays followed even
// when the answer does not report it: the list may have been asked before
// the download started, and the progress itself sees when the task ends.
// The word that an install is done stays until a load asked after it
// (`load` is its number) no longer finds the package installed.
function mergePhases(previous: Phases, entries: ServerEntry[], load: number): Phases {
  const next: Phases = {};
  for (const entry of entries) {
    const reported = phaseOf(entry);
    const kept = previous[entry.id];
    if (reported) next[entry.id] = reported;
    else if (kept?.kind === 'installed') {
      if (load <= kept.since || isInstalled(entry)) next[entry.id] = kept;
    } else if (kept && (kept.kind === 'note' || kept.kind === 'starting' || kept.kind === 'running')) next[entry.id] = kept;
  }
  return next;
}

// The task id a phase follows, or the package's own download task.
export function phaseTaskId(phase: Phase | undefined, entry: ServerEntry): string {
  return phase && 'taskId' in phase ? phase.taskId : downloadTaskId(entry.id);
}

export interface CatalogueState {
  // null until the first load.
  catalogue: Catalogue | null;
  loading: boolean;
  // Loads again; `reload` asks the servers instead of the appliance's cache.
  load: (reload?: boolean) => Promise<void>;
  phases: Phases;
  // Sets a package's phase, or with null clears it.
  setPhase: (id: string, phase: Phase | null) => void;
  // The number of the latest load asked for (loads are numbered from 1).
  lastLoad: () => number;
}

// Loads the catalogue on start and on `load`. Loads can overlap (a refresh
// while the one after an install runs): only the latest one's answer is
// shown, never an older one that came last.
export function useCatalogue(api: Api): CatalogueState {
  const [catalogue, setCatalogue] = useState<Catalogue | null>(null);
  const [loading, setLoading] = useState(true);
  const [phases, setPhases] = useState<Phases>({});
  const latestLoad = useRef(0);
  const load = useCallback(
    async (reload = false) => {
      const ticket = ++latestLoad.current;
      setLoading(true);
      const next = await loadCatalogue(api, reload);
      if (ticket !== latestLoad.current) return;
      setCatalogue(next);
      setPhases((previous) => mergePhases(previous, entriesOf(next), ticket));
      setLoading(false);
    },
    [api],
  );
  useEffect(() => {
    void load();
  }, [load]);
  const setPhase = useCallback(
    (id: string, phase: Phase | null) =>
      setPhases((previous) => {
        const next = { ...previous };
        if (phase) next[id] = phase;
        else delete next[id];
        return next;
      }),
    [],
  );
  const lastLoad = useCallback(() => latestLoad.current, []);
  return { catalogue, loading, load, phases, setPhase, lastLoad };
}

// The feed an entry of the other feeds came from: the one the appliance
// names (`feed`), else the feed whose address's folder holds the entry's
// link (the longest such), else the only feed.
function feedOf(entry: ServerEntry, feeds: Feed[]): string {
  const named = feeds.find((f) => f.feed === entry.feed);
  if (named) return named.name || named.feed;
  const folder = (f: Feed) => f.feed.slice(0, f.feed.lastIndexOf('/') + 1);
  const match = feeds
    .filter((f) => entry.link?.startsWith(folder(f)))
    .sort((a, b) => folder(b).length - folder(a).length)[0];
  return match?.name ?? (feeds.length === 1 ? feeds[0].name : 'an added feed');
}

// Where an entry comes from, in words.
export function sourceOf(entry: ServerEntry, catalogue: Catalogue | null): string {
  const feeds = catalogue?.feeds.ok ? catalogue.feeds.data.items : [];
  return entry.source === 'kivo' ? "the vendor's server" : `the feed ${feedOf(entry, feeds)}`;
}
