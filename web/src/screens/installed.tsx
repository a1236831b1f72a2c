import './installed.css';
import { Component } from 'preact';
import { useCallback, useEffect, useRef, useState } from 'preact/hooks';
import type { Api, ApiFailure, Result } from '../api/client';
import { routeHref } from '../route';
import { useSession } from '../session';
import { ErrorText } from '../ui/error-text';
import { PackageIcon } from '../ui/package-icon';
import { isBusyStatus, StatusBadge } from '../ui/status-badge';
import { PackageActions } from './package-actions';

// The installed packages: each with its icon, version, state and an upgrade
// mark when a package server offers a newer version, and what can be done
// with it. The list is fetched once and again only while some package is
// busy (installing, starting...), so an idle page sends nothing.

export interface InstalledPackage {
  id: string;
  name: string;
  version: string;
  additional?: {
    status?: string;
    startable?: boolean;
    is_uninstall_pages?: boolean;
    beta?: boolean;
    installing_progress?: number;
  };
}

const kListFields = ['status', 'startable', 'is_uninstall_pages', 'beta', 'installing_progress'];

// How often a busy package's state is asked again.
export const kPollMs = 1500;

// Loads with `load` now and whenever `reload` is called, and again every
// kPollMs while `busy` says the answer will change by itself. A load that
// finishes after a newer one started is dropped.
export function usePolled<T>(load: () => Promise<Result<T>>, busy: (data: T) => boolean) {
  const [result, setResult] = useState<Result<T> | null>(null);
  const latest = useRef(0);
  const reload = useCallback(async () => {
    const mine = ++latest.current;
    const answer = await load();
    if (mine === latest.current) setResult(answer);
  }, [load]);
  useEffect(() => {
    reload();
  }, [reload]);
  const polling = result !== null && result.ok && busy(result.data);
  useEffect(() => {
    if (!polling) return;
    const timer = setTimeout(reload, kPollMs);
    return () => clearTimeout(timer);
  }, [polling, result, reload]);
  return { result, reload };
}

interface ServerEntry {
  id?: string;
  version?: string;
  blupgrade?: boolean;
}

// The newest version each package server and feed offers for installed
// packages it has newer versions of, by id. Asked once per visit: the
// catalogue changes seldom, and the platform caches it.
function useUpgrades(api: Api): { upgrades: Map<string, string>; error: ApiFailure | null } {
  const [state, setState] = useState<{ upgrades: Map<string, string>; error: ApiFailure | null }>({ upgrades: new Map(), error: null });
  useEffect(() => {
    let live = true;
    const ask = (blloadothers: boolean) =>
      api.call<{ data?: ServerEntry[] }>('KIVO.Core.Package.Server', 'list', 1, { blloadothers });
    Promise.all([ask(false), ask(true)]).then(async (answers) => {
      const upgrades = new Map<string, string>();
      let error: ApiFailure | null = null;
      for (const answer of answers) {
        if (!answer.ok) {
          error = answer.error;
          continue;
        }
        for (const entry of answer.data.data ?? [])
          if (entry.blupgrade && entry.id && entry.version && !upgrades.has(entry.id)) upgrades.set(entry.id, entry.version);
      }
      if (live) setState({ upgrades, error });
      // Tells the appliance the user has seen the upgrades, which refreshes
      // its upgrade count on the desktop.
      if (upgrades.size === 0 || !live) return;
      const seen = await api.call('KIVO.Core.Package.Server', 'check', 1);
      if (!seen.ok && live) setState({ upgrades, error: seen.error });
    });
    return () => {
      live = false;
    };
  }, [api]);
  return state;
}

function Row({ pkg, upgrade, onChanged }: { pkg: InstalledPackage; upgrade: string | undefined; onChanged: () => void }) {
  const extra = pkg.additional ?? {};
  const progress = extra.installing_progress;
  return (
    <li class="installed-row">
      <PackageIcon id={pkg.id} version={pkg.version} />
      <div class="installed-name">
        <a href={routeHref({ screen: 'package', id: pkg.id })}>{pkg.name}</a>
        <span class="installed-version">
          {pkg.version}
          {extra.beta && <span class="badge beta">Beta</span>}
          {upgrade && <span class="badge upgrade">Upgrade to {upgrade}</span>}
        </span>
      </div>
      <div class="installed-status">
        <StatusBadge status={extra.status} withReason />
        {typeof progress === 'number' && progress >= 0 && <span class="hint"> {Math.round(progress * 100)}%</span>}
      </div>
      <PackageActions
        pkg={{ id: pkg.id, name: pkg.name, status: extra.status, startable: extra.startable, hasUninstallPages: extra.is_uninstall_pages }}
        onChanged={onChanged}
      />
    </li>
  );
}

interface RowsProps {
  packages: InstalledPackage[];
  from: number;
  upgrades: Map<string, string>;
  onChanged: () => void;
}

// kRowsPerFrame rows from `from` on. A chunk renders again only when the
// list, the upgrades or the callback changed, so growing the list by one
// chunk does not go over the chunks already shown.
class Rows extends Component<RowsProps> {
  shouldComponentUpdate(next: RowsProps): boolean {
    const p = this.props;
    return next.packages !== p.packages || next.from !== p.from || next.upgrades !== p.upgrades || next.onChanged !== p.onChanged;
  }

  render({ packages, from, upgrades, onChanged }: RowsProps) {
    return packages
      .slice(from, from + kRowsPerFrame)
      .map((pkg) => <Row key={pkg.id} pkg={pkg} upgrade={upgrades.get(pkg.id)} onChanged={onChanged} />);
  }
}

// Rows put in the document per frame: the first screenful appears at once
// and a long list grows behind it without holding the page up.
const kRowsPerFrame = 50;

function useGrowingCount(total: number): number {
  const [count, setCount] = useState(kRowsPerFrame);
  useEffect(() => {
    if (count >= total) return;
    const frame = requestAnimationFrame(() => setCount((c) => c + kRowsPerFrame));
    return () => cancelAnimationFrame(frame);
  }, [count, total]);
  return Math.min(count, total);
}

const anyBusy = (data: { packages: InstalledPackage[] }) => data.packages.some((p) => isBusyStatus(p.additional?.status));

export function InstalledScreen() {
  const { api } = useSession();
  const load = useCallback(
    () => api.call<{ packages: InstalledPackage[]; total: number }>('KIVO.Core.Package', 'list', 1, { additional: kListFields }),
    [api],
  );
  const { result, reload } = usePolled(load, anyBusy);
  const { upgrades, error: upgradeError } = useUpgrades(api);
  const packages = result?.ok ? result.data.packages : [];
  const shown = useGrowingCount(packages.length);
  return (
    <section class="installed" aria-labelledby="installed-title">
      <h1 id="installed-title">Installed packages</h1>
      {result === null && <p class="hint">Loading the installed packages…</p>}
      {result !== null && !result.ok && <ErrorText error={result.error} />}
      {upgradeError && (
        <div class="hint">
          Could not ask the package servers for upgrades: <ErrorText error={upgradeError} />
        </div>
      )}
      {result?.ok && packages.length === 0 && <p class="hint">No packages are installed.</p>}
      {packages.length > 0 && (
        <ul class="installed-list" aria-label="Installed packages">
          {Array.from({ length: Math.ceil(shown / kRowsPerFrame) }, (_, i) => (
            <Rows key={i} packages={packages} from={i * kRowsPerFrame} upgrades={upgrades} onChanged={reload} />
          ))}
        </ul>
      )}
    </section>
  );
}
