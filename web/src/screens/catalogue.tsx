// The catalogue: what the vendor's package server and the added feeds offer,
// with what the appliance knows about each package (installed, upgradable,
// a download or install under way). Recommendations come first, in the
// server's order. Installing goes through a download, the install wizard
// (screens/server-install.tsx) and a quick install; the progress shown is
// the appliance's task, so a reloaded page or a second tab finds it again
// in the catalogue's answer and follows it on.

import './catalogue.css';
import { useCallback, useEffect, useMemo, useRef, useState } from 'preact/hooks';
import type { Api, Result } from '../api/client';
import { ToolCode } from '../api/codes';
import { messageFor } from '../api/messages';
import { useSession } from '../session';
import { Dialog } from '../ui/dialog';
import { ErrorText } from '../ui/error-text';
import { OriginSwitch } from '../ui/origin-switch';
import { TaskProgress, taskFailure, type TaskData, type TaskEnd } from '../ui/task-progress';
import { ServerInstall, startedTaskId, type InstallOutcome } from './server-install';

// An entry of "Server" "list" (docs/package-server.md): the server's own keys
// and the appliance's annotations.
export interface ServerEntry {
  id: string;
  version?: string;
  dname?: string;
  desc?: string;
  maintainer?: string;
  beta?: boolean;
  blupgrade?: boolean;
  // Set on a newer version of an installed package that came from elsewhere:
  // where it came from, in words. It is no upgrade unless the origin is
  // switched.
  other_origin?: string;
  source: 'kivo' | 'others';
  status?: string;
  info?: TaskData | null;
  icon?: string | null;
  link?: string;
  size?: number;
  deppkgs?: object;
  conflictpkgs?: object;
  install_dep_services?: string;
}

interface ServerList {
  data: ServerEntry[];
  total: number;
  blupgrade: boolean;
  recommend?: ServerEntry[];
}

interface Feed {
  feed: string;
  name: string;
}

interface Catalogue {
  vendor: Result<ServerList>;
  feeds: Result<{ items: Feed[] }>;
  // null when no feed is added: there is nothing to ask then.
  others: Result<ServerList> | null;
}

// What the page shows for one package besides its description.
type Phase =
  | { kind: 'starting' }
  | { kind: 'running'; taskId: string }
  | { kind: 'downloaded'; taskId: string }
  | { kind: 'note'; text: string; failed: boolean; originRefused?: boolean };

const kDownloadTask = '@KIVOPKG_DOWNLOAD_';
const kBusyStatus = new Set(['downloading', 'installing', 'upgrading']);

async function loadCatalogue(api: Api, reload: boolean): Promise<Catalogue> {
  const [vendor, feeds] = await Promise.all([
    api.call<ServerList>('KIVO.Core.Package.Server', 'list', 1, { blforcereload: reload }),
    api.call<{ items: Feed[] }>('KIVO.Core.Package.Feed', 'list', 1),
  ]);
  const anyFeed = !feeds.ok || feeds.data.items.length > 0;
  const others = anyFeed
    ? await api.call<ServerList>('KIVO.Core.Package.Server', 'list', 1, { blforcereload: reload, blloadothers: true })
    : null;
  return { vendor, feeds, others };
}

// The task a catalogue entry reports, as the page follows it.
function phaseOf(entry: ServerEntry): Phase | null {
  const info = entry.info;
  const taskId = info?.taskid ?? kDownloadTask + entry.id;
  if (info) {
    const failed = taskFailure(info);
    if (failed !== null) return { kind: 'note', text: failed, failed: true };
    if (info.status === 'downloaded' && !info.blqinst) return { kind: 'downloaded', taskId };
    if (info.status === 'downloaded' || kBusyStatus.has(info.status ?? '')) return { kind: 'running', taskId };
  }
  if (entry.status === 'installing' || entry.status === 'upgrading') return { kind: 'running', taskId };
  return null;
}

function entriesOf(catalogue: Catalogue): ServerEntry[] {
  return [...(catalogue.vendor.ok ? catalogue.vendor.data.data : []), ...(catalogue.others?.ok ? catalogue.others.data.data : [])];
}

// The tasks the appliance reports win; the page's own notes stay until the
// package has a task again. A download the page follows stays followed even
// when the answer does not report it: the list may have been asked before
// the download started, and the progress itself sees when the task ends.
function mergePhases(previous: Record<string, Phase>, entries: ServerEntry[]): Record<string, Phase> {
  const next: Record<string, Phase> = {};
  for (const entry of entries) {
    const reported = phaseOf(entry);
    const kept = previous[entry.id];
    if (reported) next[entry.id] = reported;
    else if (kept && (kept.kind === 'note' || kept.kind === 'starting' || kept.kind === 'running')) next[entry.id] = kept;
  }
  return next;
}

// The feed an entry of the other feeds came from: the feed whose address's
// folder holds the entry's link (the longest such), else the only feed.
function feedOf(entry: ServerEntry, feeds: Feed[]): string {
  const folder = (f: Feed) => f.feed.slice(0, f.feed.lastIndexOf('/') + 1);
  const match = feeds
    .filter((f) => entry.link?.startsWith(folder(f)))
    .sort((a, b) => folder(b).length - folder(a).length)[0];
  return match?.name ?? (feeds.length === 1 ? feeds[0].name : 'an added feed');
}

// The entry's own file, named to the install: a switch of origin goes to
// the very source the administrator chose, not to whichever lists the
// package too.
export function entryLink(entry: ServerEntry): { url?: string; filesize?: number } {
  return entry.link ? { url: entry.link, filesize: entry.size ?? 0 } : {};
}

function matches(entry: ServerEntry, query: string): boolean {
  const q = query.trim().toLowerCase();
  if (q === '') return true;
  return [entry.dname, entry.id, entry.desc, entry.maintainer].some((text) => text?.toLowerCase().includes(q));
}

const kInstalledWords: Record<string, string> = {
  running: 'Installed, running',
  stop: 'Installed, stopped',
  broken: 'Installed, broken',
  installing: 'Installing',
  upgrading: 'Upgrading',
  uninstalling: 'Uninstalling',
};

function isInstalled(entry: ServerEntry): boolean {
  return entry.status !== undefined && entry.status !== 'non_installed';
}

function EntryCard({
  entry,
  from,
  phase,
  onInstall,
  onSwitch,
  onEnd,
  onContinue,
  onDiscard,
}: {
  entry: ServerEntry;
  from: string;
  phase: Phase | undefined;
  onInstall: () => void;
  onSwitch: () => void;
  onEnd: (end: TaskEnd) => void;
  onContinue: () => void;
  onDiscard: () => void;
}) {
  const { api } = useSession();
  const name = entry.dname || entry.id;
  const headingId = `catalogue-${entry.source}-${entry.id}`;
  const icon = api.url('KIVO.Core.Package.Thumb.Server', 'get', 1, { name: entry.id, ver: entry.version ?? '', size: 72, link: entry.icon ?? '' });
  const installed = isInstalled(entry);
  const canInstall = !phase || phase.kind === 'note';
  const canSwitch = canInstall && installed && (entry.other_origin !== undefined || (phase?.kind === 'note' && phase.originRefused === true));
  return (
    <li class="catalogue-entry" aria-labelledby={headingId}>
      <img class="catalogue-icon" src={icon} alt="" width={72} height={72} loading="lazy" />
      <div class="catalogue-text">
        <h3 id={headingId}>{name}</h3>
        <p class="catalogue-meta">
          <span>Version {entry.version ?? 'unknown'}</span>
          {entry.beta && <span class="badge beta">Beta</span>}
          {entry.blupgrade && <span class="badge upgrade">Upgrade available</span>}
          {installed && !entry.blupgrade && <span class="badge running">{kInstalledWords[entry.status ?? ''] ?? 'Installed'}</span>}
        </p>
        {entry.desc && <p class="catalogue-desc">{entry.desc}</p>}
        <p class="catalogue-from">From {from}</p>
        {phase?.kind === 'note' && (
          <p class={phase.failed ? 'error' : 'hint'} role={phase.failed ? 'alert' : 'status'}>
            {phase.text}
          </p>
        )}
        {phase?.kind === 'running' && <TaskProgress taskId={phase.taskId} name={name} onEnd={onEnd} />}
        {phase?.kind === 'starting' && <p class="hint">Starting the download of {name}…</p>}
        {phase?.kind === 'downloaded' && (
          <div class="buttons start">
            <span class="hint">Downloaded, waiting for the install wizard.</span>
            <button type="button" class="primary" onClick={onContinue}>
              Continue install
            </button>
            <button type="button" onClick={onDiscard}>
              Discard download
            </button>
          </div>
        )}
        {canSwitch && (
          <div class="buttons start">
            {entry.other_origin && <span class="hint">Installed from {entry.other_origin}, which it is updated from.</span>}
            <button type="button" onClick={onSwitch} aria-label={`Switch ${name} to ${from}`}>
              Switch to this source…
            </button>
          </div>
        )}
        {canInstall && (!installed || entry.blupgrade) && (
          <div class="buttons start">
            <button type="button" class="primary" onClick={onInstall} aria-label={`${entry.blupgrade ? 'Upgrade' : 'Install'} ${name}`}>
              {entry.blupgrade ? 'Upgrade' : 'Install'}
            </button>
          </div>
        )}
      </div>
    </li>
  );
}

export function CatalogueScreen() {
  const { api } = useSession();
  const [catalogue, setCatalogue] = useState<Catalogue | null>(null);
  const [loading, setLoading] = useState(true);
  const [phases, setPhases] = useState<Record<string, Phase>>({});
  const [wizard, setWizard] = useState<{ entry: ServerEntry; taskId: string } | null>(null);
  // The entry whose source the administrator is asked to switch to.
  const [switchAsk, setSwitchAsk] = useState<ServerEntry | null>(null);
  // Packages being installed with their origin switched to the entry's
  // source, by the administrator's confirmation.
  const switching = useRef(new Set<string>());
  const [query, setQuery] = useState('');
  // Packages whose download this page started: their wizard opens by itself
  // when the download is done (another tab only offers to continue).
  const mine = useRef(new Set<string>());
  // Loads can overlap (a refresh while the one after an install runs): only
  // the latest one's answer is shown, never an older one that came last.
  const latestLoad = useRef(0);

  const load = useCallback(
    async (reload = false) => {
      const ticket = ++latestLoad.current;
      setLoading(true);
      const next = await loadCatalogue(api, reload);
      if (ticket !== latestLoad.current) return;
      setCatalogue(next);
      setPhases((previous) => mergePhases(previous, entriesOf(next)));
      setLoading(false);
    },
    [api],
  );
  useEffect(() => {
    void load();
  }, [load]);

  const setPhase = (id: string, phase: Phase | null) =>
    setPhases((previous) => {
      const next = { ...previous };
      if (phase) next[id] = phase;
      else delete next[id];
      return next;
    });

  const install = async (entry: ServerEntry, switchOrigin = false) => {
    setPhase(entry.id, { kind: 'starting' });
    mine.current.add(entry.id);
    if (switchOrigin) switching.current.add(entry.id);
    else switching.current.delete(entry.id);
    // A plain download first: the wizard needs what the package file says.
    const answer = await api.call<{ taskid?: string; data?: TaskData }>('KIVO.Core.Package.Installation', 'install', 1, {
      name: entry.id,
      is_kivo: entry.source === 'kivo',
      ...(switchOrigin ? entryLink(entry) : {}),
    });
    if (answer.ok) setPhase(entry.id, { kind: 'running', taskId: startedTaskId(answer.data, entry.id) });
    else setPhase(entry.id, { kind: 'note', text: messageFor(answer.error), failed: true });
  };

  const ended = (entry: ServerEntry, taskId: string, end: TaskEnd) => {
    const name = entry.dname || entry.id;
    if (end.kind === 'done' && end.data.status === 'downloaded' && !end.data.blqinst) {
      setPhase(entry.id, { kind: 'downloaded', taskId });
      if (mine.current.delete(entry.id)) setWizard({ entry, taskId });
      return;
    }
    mine.current.delete(entry.id);
    if (end.kind === 'failed')
      setPhase(entry.id, { kind: 'note', text: end.text, failed: true, originRefused: end.result === ToolCode.OtherOrigin });
    else if (end.kind === 'cancelled') setPhase(entry.id, { kind: 'note', text: `The download of ${name} was cancelled.`, failed: false });
    else if (end.kind === 'done' && end.data.status === 'installed') setPhase(entry.id, { kind: 'note', text: `${name} is installed.`, failed: false });
    else setPhase(entry.id, null);
    // What the package is now (installed, running) comes from the appliance.
    if (end.kind !== 'cancelled') void load();
  };

  const discard = async (entry: ServerEntry, taskId: string) => {
    const answer = await api.call('KIVO.Core.Package.Installation', 'cancel', 1, { taskid: taskId });
    if (answer.ok) setPhase(entry.id, { kind: 'note', text: 'The download was discarded.', failed: false });
    else setPhase(entry.id, { kind: 'note', text: messageFor(answer.error), failed: true });
  };

  const wizardClosed = (entry: ServerEntry, outcome: InstallOutcome) => {
    setWizard(null);
    if (outcome.kind === 'started') setPhase(entry.id, { kind: 'running', taskId: outcome.taskId });
    else if (outcome.kind === 'discarded') setPhase(entry.id, outcome.reason ? { kind: 'note', text: outcome.reason, failed: true } : null);
  };

  const feeds = catalogue?.feeds.ok ? catalogue.feeds.data.items : [];
  const vendor = catalogue?.vendor.ok ? catalogue.vendor.data : null;
  const recommended = useMemo(() => (vendor?.recommend ?? []).filter((e) => matches(e, query)), [vendor, query]);
  const recommendedIds = new Set((vendor?.recommend ?? []).map((e) => e.id));
  const vendorRest = (vendor?.data ?? []).filter((e) => !recommendedIds.has(e.id) && matches(e, query));
  const fromFeeds = (catalogue?.others?.ok ? catalogue.others.data.data : []).filter((e) => matches(e, query));
  const upgrades = (catalogue ? entriesOf(catalogue) : []).filter((e) => e.blupgrade).length;

  const fromOf = (entry: ServerEntry) => (entry.source === 'kivo' ? "the vendor's server" : `the feed ${feedOf(entry, feeds)}`);
  const card = (entry: ServerEntry) => (
    <EntryCard
      key={`${entry.source}-${entry.id}`}
      entry={entry}
      from={fromOf(entry)}
      phase={phases[entry.id]}
      onInstall={() => void install(entry)}
      onSwitch={() => setSwitchAsk(entry)}
      onEnd={(end) => {
        const phase = phases[entry.id];
        ended(entry, phase && 'taskId' in phase ? phase.taskId : kDownloadTask + entry.id, end);
      }}
      onContinue={() => {
        const phase = phases[entry.id];
        if (phase?.kind === 'downloaded') setWizard({ entry, taskId: phase.taskId });
      }}
      onDiscard={() => {
        const phase = phases[entry.id];
        if (phase?.kind === 'downloaded') void discard(entry, phase.taskId);
      }}
    />
  );

  const nothingFound = catalogue !== null && query.trim() !== '' && recommended.length + vendorRest.length + fromFeeds.length === 0;
  return (
    <section class="catalogue" aria-labelledby="catalogue-title">
      <div class="catalogue-head">
        <h1 id="catalogue-title">All packages</h1>
        <div class="catalogue-tools">
          <input
            type="search"
            aria-label="Search packages"
            placeholder="Search packages"
            value={query}
            onInput={(e) => setQuery(e.currentTarget.value)}
          />
          <button type="button" onClick={() => void load(true)} disabled={loading}>
            {loading ? 'Loading…' : 'Refresh'}
          </button>
        </div>
      </div>
      {catalogue === null && <p class="loading">Loading the catalogue…</p>}
      {upgrades > 0 && (
        <p class="hint" role="status">
          {upgrades === 1 ? 'One installed package has an upgrade.' : `${upgrades} installed packages have upgrades.`}
        </p>
      )}
      {nothingFound && <p class="hint">No package matches “{query.trim()}”.</p>}
      {catalogue && !catalogue.vendor.ok && (
        <div class="catalogue-problem">
          <p>The vendor's package server sent no catalogue: it may be unreachable or answer something else.</p>
          <ErrorText error={catalogue.vendor.error} />
        </div>
      )}
      {recommended.length > 0 && (
        <>
          <h2>Recommended</h2>
          <ul class="catalogue-list">{recommended.map(card)}</ul>
        </>
      )}
      {vendorRest.length > 0 && (
        <>
          <h2>{recommended.length > 0 ? 'More from the vendor' : 'From the vendor'}</h2>
          <ul class="catalogue-list">{vendorRest.map(card)}</ul>
        </>
      )}
      {catalogue && !catalogue.feeds.ok && (
        <div class="catalogue-problem">
          <p>The list of added feeds could not be read.</p>
          <ErrorText error={catalogue.feeds.error} />
        </div>
      )}
      {catalogue?.others && !catalogue.others.ok && (
        <div class="catalogue-problem">
          <p>The added feeds sent no catalogue: they may be unreachable or answer something else.</p>
          <ErrorText error={catalogue.others.error} />
        </div>
      )}
      {fromFeeds.length > 0 && (
        <>
          <h2>From added feeds</h2>
          <ul class="catalogue-list">{fromFeeds.map(card)}</ul>
        </>
      )}
      {wizard && (
        <ServerInstall
          entry={wizard.entry}
          taskId={wizard.taskId}
          switchOrigin={switching.current.has(wizard.entry.id)}
          onClose={(outcome) => wizardClosed(wizard.entry, outcome)}
        />
      )}
      {switchAsk && (
        <Dialog title={`Switch the origin of ${switchAsk.dname || switchAsk.id}`} onClose={() => setSwitchAsk(null)}>
          <OriginSwitch
            name={switchAsk.dname || switchAsk.id}
            installedFrom={switchAsk.other_origin}
            source={fromOf(switchAsk)}
            onSwitch={() => {
              const entry = switchAsk;
              setSwitchAsk(null);
              void install(entry, true);
            }}
            onCancel={() => setSwitchAsk(null)}
          />
        </Dialog>
      )}
    </section>
  );
}
