import './installed.css';
import { Component } from 'preact';
import { useCallback, useEffect, useState } from 'preact/hooks';
import type { Result } from '../api/client';
import { listPackages, type PackageInfo } from '../api/package';
import type { ServerEntry } from '../api/server';
import { routeHref } from '../route';
import { useSession } from '../session';
import { ErrorText } from '../ui/error-text';
import { PackageActions, type ActionFields } from '../ui/package-actions';
import { ConfinementBadge } from '../ui/package-confinement';
import { PackageIcon } from '../ui/package-icon';
import { usePoll } from '../ui/poll';
import { isBusyStatus, kBusyPollMs, StatusBadge } from '../ui/status-badge';
import { UsageLine, UsageViews } from '../ui/package-usage';
import { useUpgradeOffers } from '../ui/upgrade-flow';
import { WatchdogNote, WatchdogViews } from '../ui/watchdog-note';

// The installed packages: each with its icon, version, state and what can
// be done with it (open its page, upgrade it when a package server offers a
// newer version, start, stop, uninstall). The list is fetched once and again
// only while some package is busy (installing, starting...), so an idle
// page sends nothing.

// The fields of "list" the page shows, besides those of its actions.
interface ListFields extends ActionFields {
  beta?: boolean;
  installing_progress?: number;
}

type InstalledPackage = PackageInfo<ListFields>;

const kListFields = ['status', 'startable', 'is_uninstall_pages', 'beta', 'installing_progress', 'url'];

function Row({
  pkg,
  upgrade,
  onChanged,
  onUpgraded,
  onRemoved,
}: {
  pkg: InstalledPackage;
  upgrade: ServerEntry | undefined;
  onChanged: () => void;
  onUpgraded: () => void;
  onRemoved: (words: string) => void;
}) {
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
          {upgrade && <span class="badge upgrade">{upgrade.version} available</span>}
        </span>
      </div>
      <div class="installed-status">
        <StatusBadge status={extra.status} withReason />
        <ConfinementBadge id={pkg.id} />
        {typeof progress === 'number' && progress >= 0 && <span class="hint"> {Math.round(progress * 100)}%</span>}
        <WatchdogNote id={pkg.id} name={pkg.name} onStarted={onChanged} />
        <UsageLine id={pkg.id} />
      </div>
      <PackageActions
        pkg={pkg}
        upgrade={upgrade}
        onChanged={onChanged}
        onUpgraded={onUpgraded}
        onRemoved={onRemoved}
      />
    </li>
  );
}

interface RowsProps {
  packages: InstalledPackage[];
  from: number;
  upgrades: Map<string, ServerEntry>;
  onChanged: () => void;
  onUpgraded: () => void;
  onRemoved: (words: string) => void;
}

// kRowsPerFrame rows from `from` on. A chunk renders again only when the
// list, the upgrades or the callback changed, so growing the list by one
// chunk does not go over the chunks already shown.
class Rows extends Component<RowsProps> {
  shouldComponentUpdate(next: RowsProps): boolean {
    const p = this.props;
    return (
      next.packages !== p.packages || next.from !== p.from || next.upgrades !== p.upgrades || next.onChanged !== p.onChanged || next.onRemoved !== p.onRemoved || next.onUpgraded !== p.onUpgraded
    );
  }

  render({ packages, from, upgrades, onChanged, onUpgraded, onRemoved }: RowsProps) {
    return packages
      .slice(from, from + kRowsPerFrame)
      .map((pkg) => <Row key={pkg.id} pkg={pkg} upgrade={upgrades.get(pkg.id)} onChanged={onChanged} onUpgraded={onUpgraded} onRemoved={onRemoved} />);
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

const anyBusy = (result: Result<{ packages: InstalledPackage[] }>) => result.ok && result.data.packages.some((p) => isBusyStatus(p.additional?.status));

export function InstalledScreen() {
  const { api } = useSession();
  const load = useCallback(() => listPackages<ListFields>(api, kListFields), [api]);
  const { result, reload } = usePoll(load, { everyMs: kBusyPollMs, again: anyBusy });
  // Asked again after an upgrade: what is offered changes with what is
  // installed.
  const [upgraded, setUpgraded] = useState(0);
  const { offers: upgrades, error: upgradeError } = useUpgradeOffers(api, true, upgraded);
  const onUpgraded = useCallback(() => {
    setUpgraded((n) => n + 1);
    void reload();
  }, [reload]);
  // The last package removed, in words, until another is.
  const [removed, setRemoved] = useState<string | null>(null);
  const onRemoved = useCallback(
    (words: string) => {
      setRemoved(words);
      void reload();
    },
    [reload],
  );
  const packages = result?.ok ? result.data.packages : [];
  const shown = useGrowingCount(packages.length);
  return (
    <section class="installed" aria-labelledby="installed-title">
      <h1 id="installed-title">Installed packages</h1>
      <p class="hint" role="status">
        {removed}
      </p>
      {result === null && <p class="hint">Loading the installed packages…</p>}
      {result !== null && !result.ok && <ErrorText error={result.error} />}
      {upgradeError && (
        <div class="hint">
          Could not ask the package servers for upgrades: <ErrorText error={upgradeError} />
        </div>
      )}
      {result?.ok && packages.length === 0 && <p class="hint">No packages are installed.</p>}
      {packages.length > 0 && (
        <WatchdogViews refresh={result}>
          <UsageViews refresh={result}>
            <ul class="installed-list" aria-label="Installed packages">
              {Array.from({ length: Math.ceil(shown / kRowsPerFrame) }, (_, i) => (
                <Rows key={i} packages={packages} from={i * kRowsPerFrame} upgrades={upgrades} onChanged={reload} onUpgraded={onUpgraded} onRemoved={onRemoved} />
              ))}
            </ul>
          </UsageViews>
        </WatchdogViews>
      )}
    </section>
  );
}
