import './package-details.css';
import { useCallback, useState } from 'preact/hooks';
import { screenshotUrl } from '../api/images';
import { getPackage, packageLog } from '../api/package';
import { routeHref } from '../route';
import { useSession } from '../session';
import { ErrorText } from '../ui/error-text';
import { KeptVersionPanel } from '../ui/kept-version';
import { PackageActions, type ActionFields } from '../ui/package-actions';
import { ConfinementFacts } from '../ui/package-confinement';
import { PackageHistory } from '../ui/package-history';
import { PackageHold } from '../ui/package-hold';
import { PackageIcon } from '../ui/package-icon';
import { usePoll } from '../ui/poll';
import { usePackageNames } from '../ui/package-names';
import { isBusyStatus, kBusyPollMs, StatusBadge } from '../ui/status-badge';
import { UsageFacts, UsageViews } from '../ui/package-usage';
import { useUpgradeOffers } from '../ui/upgrade-flow';
import { WatchdogNote, WatchdogViews } from '../ui/watchdog-note';

// One installed package: what it is, who makes it, where to get help, what
// it needs, the address of its own web page while it runs, its screenshots
// and its log, with what can be done with it (an upgrade a package server
// offers included).

interface Dependency {
  operator?: string;
  version?: string;
}

// The fields of "get" the page shows, besides those of its actions.
interface DetailFields extends ActionFields {
  description?: string;
  maintainer?: string;
  maintainer_url?: string;
  distributor?: string;
  distributor_url?: string;
  help_url?: string;
  support_url?: string;
  report_beta_url?: string;
  beta?: boolean;
  dependent_packages?: Record<string, Dependency> | null;
  installed_info?: { path?: string };
}

const kDetailFields = [
  'description',
  'maintainer',
  'maintainer_url',
  'distributor',
  'distributor_url',
  'help_url',
  'support_url',
  'report_beta_url',
  'beta',
  'startable',
  'status',
  'url',
  'is_uninstall_pages',
  'dependent_packages',
  'installed_info',
];

// Only web addresses become links: a package's INFO could hold anything.
function isWebAddress(text: string | undefined): text is string {
  return !!text && /^https?:\/\//i.test(text);
}

function Person({ label, name, url }: { label: string; name?: string; url?: string }) {
  if (!name && !url) return null;
  return (
    <>
      <dt>{label}</dt>
      <dd>{isWebAddress(url) ? <a href={url}>{name || url}</a> : name}</dd>
    </>
  );
}

function Links({ extra }: { extra: DetailFields }) {
  const links = [
    { label: 'Help', url: extra.help_url },
    { label: 'Support', url: extra.support_url },
    { label: 'Report a fault in this beta', url: extra.report_beta_url },
  ].filter((l) => isWebAddress(l.url));
  if (links.length === 0) return null;
  return (
    <>
      <dt>Links</dt>
      <dd>
        <ul class="inline-list">
          {links.map((l) => (
            <li key={l.label}>
              <a href={l.url}>{l.label}</a>
            </li>
          ))}
        </ul>
      </dd>
    </>
  );
}

function Dependencies({ deps }: { deps: Record<string, Dependency> | null | undefined }) {
  const { api } = useSession();
  const ids = Object.keys(deps ?? {});
  const nameOf = usePackageNames(api, ids.length > 0);
  return (
    <>
      <dt>Needs</dt>
      <dd>
        {ids.length === 0 ? (
          'No other packages.'
        ) : (
          <ul class="inline-list">
            {ids.map((id) => {
              const dep = deps?.[id] ?? {};
              return (
                <li key={id}>
                  <a href={routeHref({ screen: 'package', id })}>{nameOf(id)}</a>
                  {dep.operator && dep.version ? ` ${dep.operator} ${dep.version}` : ''}
                </li>
              );
            })}
          </ul>
        )}
      </dd>
    </>
  );
}

function WebAddress({ url }: { url: string | string[] | undefined }) {
  const urls = (Array.isArray(url) ? url : [url]).filter(isWebAddress);
  if (urls.length === 0) return null;
  return (
    <>
      <dt>Its web page</dt>
      <dd>
        {urls.map((u) => (
          <a key={u} href={u} target="_blank" rel="noopener noreferrer">
            {u}
          </a>
        ))}
      </dd>
    </>
  );
}

// A package has up to eight screenshots and the API does not say how
// many: each one is asked for after the one before it loaded, and the first
// that is missing ends the row.
function Screenshots({ id, name, version }: { id: string; name: string; version: string }) {
  const { api } = useSession();
  const [loaded, setLoaded] = useState(0);
  const [ended, setEnded] = useState(false);
  const shown = ended ? loaded : Math.min(loaded + 1, 8);
  const indexes = Array.from({ length: shown }, (_, i) => i + 1);
  return (
    <section aria-labelledby="screenshots-title" hidden={loaded === 0}>
      <h2 id="screenshots-title">Screenshots</h2>
      <div class="screenshots">
        {indexes.map((index) => (
          <img
            key={index}
            src={screenshotUrl(api, id, version, index)}
            alt={`Screenshot ${index} of ${name}`}
            hidden={index > loaded}
            onLoad={() => setLoaded((n) => Math.max(n, index))}
            onError={() => setEnded(true)}
          />
        ))}
      </div>
    </section>
  );
}

function Log({ id }: { id: string }) {
  const { api } = useSession();
  const load = useCallback(() => packageLog(api, id), [api, id]);
  // Asked once; the button asks again.
  const { result, reload } = usePoll(load, { everyMs: kBusyPollMs, again: () => false });
  return (
    <section aria-labelledby="log-title">
      <div class="section-head">
        <h2 id="log-title">Log</h2>
        <button type="button" onClick={reload}>
          Refresh log
        </button>
      </div>
      {result === null && <p class="hint">Loading the log…</p>}
      {result !== null && !result.ok && <ErrorText error={result.error} />}
      {result?.ok && (result.data.pkglog === '' ? <p class="hint">The package has written no log.</p> : <pre class="log">{result.data.pkglog}</pre>)}
    </section>
  );
}

export function PackageScreen({ id }: { id: string }) {
  const { api } = useSession();
  const load = useCallback(() => getPackage<DetailFields>(api, id, kDetailFields), [api, id]);
  const { result, reload } = usePoll(load, { everyMs: kBusyPollMs, again: (r) => r.ok && isBusyStatus(r.data.additional?.status) });
  // Asked again after an upgrade: what is offered changes with what is
  // installed.
  const [upgraded, setUpgraded] = useState(0);
  const { offers } = useUpgradeOffers(api, false, upgraded);
  // The words that the package was uninstalled, once it was.
  const [removed, setRemoved] = useState<string | null>(null);
  const back = (
    <p>
      <a href={routeHref({ screen: 'installed' })}>← Installed packages</a>
    </p>
  );
  if (removed !== null)
    return (
      <section>
        {back}
        <p role="status">{removed}</p>
      </section>
    );
  if (result === null) return <p class="hint">Loading {id}…</p>;
  if (!result.ok)
    return (
      <section>
        {back}
        <h1>{id}</h1>
        <ErrorText error={result.error} />
      </section>
    );
  const pkg = result.data;
  const extra = pkg.additional ?? {};
  return (
    <article class="package-details" aria-labelledby="details-title">
      {back}
      <header class="details-head">
        <PackageIcon id={pkg.id} version={pkg.version} size={256} shown={72} />
        <div>
          <h1 id="details-title">{pkg.name}</h1>
          <p class="details-version">
            Version {pkg.version} {extra.beta && <span class="badge beta">Beta</span>}{' '}
            {offers.has(pkg.id) && <span class="badge upgrade">{offers.get(pkg.id)?.version} available</span>} <StatusBadge status={extra.status} withReason />
          </p>
        </div>
        <PackageActions
          pkg={pkg}
          upgrade={offers.get(pkg.id)}
          onChanged={reload}
          onUpgraded={() => {
            setUpgraded((n) => n + 1);
            void reload();
          }}
          onRemoved={setRemoved}
        />
      </header>
      <WatchdogViews refresh={result}>
        <WatchdogNote id={pkg.id} name={pkg.name} onStarted={() => void reload()} />
      </WatchdogViews>
      {extra.description && <p class="details-description">{extra.description}</p>}
      <dl class="details-facts">
        <WebAddress url={extra.status === 'running' ? extra.url : undefined} />
        <Person label="Maintainer" name={extra.maintainer} url={extra.maintainer_url} />
        <Person label="Distributor" name={extra.distributor} url={extra.distributor_url} />
        <Links extra={extra} />
        <Dependencies deps={extra.dependent_packages} />
        <UsageViews refresh={result}>
          <UsageFacts id={pkg.id} />
          <ConfinementFacts id={pkg.id} />
        </UsageViews>
        {extra.installed_info?.path && (
          <>
            <dt>Installed in</dt>
            <dd>
              <code>{extra.installed_info.path}</code>
            </dd>
          </>
        )}
      </dl>
      <KeptVersionPanel
        id={pkg.id}
        name={pkg.name}
        onChanged={() => {
          // Another version is installed: what is offered changes too.
          setUpgraded((n) => n + 1);
          void reload();
        }}
      />
      <PackageHold id={pkg.id} name={pkg.name} />
      <Screenshots id={pkg.id} name={pkg.name} version={pkg.version} />
      <PackageHistory id={pkg.id} changed={result} />
      <Log id={pkg.id} />
    </article>
  );
}
