import './package-actions.css';
import { useState } from 'preact/hooks';
import type { Api, ApiFailure, Result } from '../api/client';
import { PackageCode } from '../api/codes';
import { controlPackages, uninstallPackage } from '../api/control';
import { explain } from '../api/messages';
import { feasibilityCheck, getPackage, type PackageInfo } from '../api/package';
import type { ServerEntry } from '../api/server';
import { useSession } from '../session';
import { Dialog } from './dialog';
import { OpenLink } from './open-link';
import { usePackageNames } from './package-names';
import { Steps, type StepPage } from './steps';
import { UpgradeFlow } from './upgrade-flow';
import { decodeWizard, initialWizardValues, WizardStepForm, wizardStepProblem, type WizardStep, type WizardValues } from './wizard';
import { isBusyStatus } from './status-badge';

// What can be done with one installed package: open its web page while it
// runs, upgrade it when a package server offers a newer version (the same
// upgrade dialog as the catalogue's, ui/upgrade-flow.tsx), start, stop and
// uninstall it. Stop and uninstall ask the appliance first whether they are
// allowed (the feasibility check, docs/feasibility.md): hard reasons refuse
// and are shown, soft reasons are shown and need a confirmation. The check
// knows no start: what a start needs (its dependencies running) the start
// itself refuses, and says so.

// The fields of the appliance's "list" and "get" answers the actions need;
// a screen asks for them among its own.
export interface ActionFields {
  status?: string;
  startable?: boolean;
  is_uninstall_pages?: boolean;
  // Its web page's address(es) while it runs.
  url?: string | string[];
}

interface ActionPackage {
  id: string;
  name: string;
  version: string;
  status?: string;
  startable?: boolean;
  hasUninstallPages?: boolean;
  url?: string | string[];
  // The newer version a package server offers.
  upgrade?: ServerEntry;
}

function actionPackage(pkg: PackageInfo<ActionFields>, upgrade: ServerEntry | undefined): ActionPackage {
  const extra = pkg.additional ?? {};
  return {
    id: pkg.id,
    name: pkg.name,
    version: pkg.version,
    status: extra.status,
    startable: extra.startable,
    hasUninstallPages: extra.is_uninstall_pages,
    url: extra.url,
    upgrade,
  };
}

type Action = 'start' | 'stop' | 'uninstall';

const kVerbs: Record<Action, { label: string; doing: string; failed: string }> = {
  start: { label: 'Start', doing: 'Starting', failed: 'Could not start' },
  stop: { label: 'Stop', doing: 'Stopping', failed: 'Could not stop' },
  uninstall: { label: 'Uninstall', doing: 'Uninstalling', failed: 'Could not uninstall' },
};

type Flow =
  | { kind: 'checking'; action: Action }
  | { kind: 'refused'; action: Action; reasons: string[]; error: ApiFailure }
  | { kind: 'confirm'; action: Action; reasons: string[] }
  | { kind: 'uninstall'; reasons: string[]; wizard: WizardStep[] }
  | { kind: 'running'; action: Action }
  | { kind: 'failed'; action: Action; error: ApiFailure };

type Feasibility = { allowed: true; soft: string[] } | { allowed: false; hard: string[]; error: ApiFailure };

function strings(value: unknown): string[] {
  return Array.isArray(value) ? value.filter((v): v is string => typeof v === 'string') : [];
}

// Whether the appliance allows `action`; soft reasons still allow it. A
// check that cannot be made refuses, as the API does.
async function checkFeasible(api: Api, action: 'stop' | 'uninstall', id: string): Promise<Feasibility> {
  const type = action === 'stop' ? 'stop_check' : 'uninstall_check';
  const answer = await feasibilityCheck(api, type, [id]);
  if (answer.ok) return { allowed: true, soft: [] };
  const { code, errors } = answer.error;
  if (code === PackageCode.NotFeasible && errors?.check_type === 'soft') return { allowed: true, soft: strings(errors.reasons) };
  return { allowed: false, hard: code === PackageCode.NotFeasible ? strings(errors?.reasons) : [], error: answer.error };
}

// A failure in words, with what stands in the way (packages, by their
// display names, versions, services, what the package's scripts said) as a
// list beneath.
export function ActionFailure({ error }: { error: ApiFailure }) {
  const { api } = useSession();
  const nameOf = usePackageNames(api, true);
  const { summary, details } = explain(error, nameOf);
  return (
    <div class="action-failure" role="alert" data-code={error.code}>
      <p class="error">{summary}</p>
      {details.length > 0 && <Reasons reasons={details} />}
    </div>
  );
}

function Reasons({ reasons }: { reasons: string[] }) {
  return (
    <ul class="reasons">
      {reasons.map((r) => (
        <li key={r}>{r}</li>
      ))}
    </ul>
  );
}

async function control(api: Api, action: Action, id: string, wizard: WizardValues | null): Promise<Result<unknown>> {
  if (action === 'uninstall') {
    // The API takes the wizard's answers as one JSON text.
    const extra = wizard ? JSON.stringify(wizard) : undefined;
    return uninstallPackage(api, id, extra);
  }
  return controlPackages(api, action, [id]);
}

// The uninstall's pages: the soft reasons to confirm, the package's own
// wizard, then the last word before removing.
function uninstallPages(name: string, reasons: string[], wizard: WizardStep[], values: WizardValues, onValues: (v: WizardValues) => void) {
  const pages: StepPage[] = [];
  if (reasons.length > 0)
    pages.push({ title: 'Before you go on', body: <Reasons reasons={reasons} />, nextLabel: 'Continue anyway' });
  for (const step of wizard)
    pages.push({
      title: step.step_title || 'Options',
      body: <WizardStepForm step={step} values={values} onChange={onValues} />,
      problem: wizardStepProblem(step, values),
    });
  pages.push({ title: 'Confirm', body: <p>{name} and the data it keeps will be removed from the appliance.</p> });
  return pages;
}

// Buttons for what can be done with `pkg` (as the appliance lists it) now,
// `upgrade` the newer version a package server offers, if any; `onChanged`
// runs when its state may have changed (also when an action begins, so a
// list shows the package as busy), `onUpgraded` when the upgrade dialog closed (what is
// installed and offered may have changed), `onRemoved` after an uninstall,
// with the words that say so.
export function PackageActions({
  pkg: listed,
  upgrade: offered,
  onChanged,
  onUpgraded,
  onRemoved,
}: {
  pkg: PackageInfo<ActionFields>;
  upgrade: ServerEntry | undefined;
  onChanged: () => void;
  onUpgraded: () => void;
  onRemoved: (words: string) => void;
}) {
  const pkg = actionPackage(listed, offered);
  const { api } = useSession();
  const [flow, setFlow] = useState<Flow | null>(null);
  const [values, setValues] = useState<WizardValues>({});
  const [upgrading, setUpgrading] = useState(false);
  const busy = isBusyStatus(pkg.status) || flow !== null || upgrading;

  const run = async (action: Action, wizard: WizardValues | null) => {
    setFlow({ kind: 'running', action });
    const pending = control(api, action, pkg.id, wizard);
    onChanged();
    const answer = await pending;
    if (!answer.ok) {
      setFlow({ kind: 'failed', action, error: answer.error });
      onChanged();
      return;
    }
    setFlow(null);
    if (action === 'uninstall') onRemoved(`${pkg.name} was uninstalled.`);
    else onChanged();
  };

  const begin = async (action: Action) => {
    if (action === 'start') return run('start', null);
    setFlow({ kind: 'checking', action });
    const feasible = await checkFeasible(api, action, pkg.id);
    if (!feasible.allowed) return setFlow({ kind: 'refused', action, reasons: feasible.hard, error: feasible.error });
    if (action === 'stop') return feasible.soft.length > 0 ? setFlow({ kind: 'confirm', action, reasons: feasible.soft }) : run('stop', null);
    let wizard: WizardStep[] = [];
    if (pkg.hasUninstallPages) {
      const got = await getPackage<{ uninstall_pages?: string }>(api, pkg.id, ['uninstall_pages']);
      if (!got.ok) return setFlow({ kind: 'failed', action, error: got.error });
      wizard = decodeWizard(got.data.additional?.uninstall_pages) ?? [];
    }
    setValues(initialWizardValues(wizard));
    setFlow({ kind: 'uninstall', reasons: feasible.soft, wizard });
  };

  const close = () => setFlow(null);
  const canControl = pkg.startable !== false && !busy;
  const upgrade = pkg.upgrade;
  return (
    <div class="package-actions">
      {pkg.status === 'running' && <OpenLink name={pkg.name} url={pkg.url} />}
      {upgrade && (
        <button type="button" class="primary" aria-label={`Upgrade ${pkg.name} to ${upgrade.version}`} disabled={busy} onClick={() => setUpgrading(true)}>
          Upgrade
        </button>
      )}
      {pkg.status === 'running' ? (
        <button type="button" aria-label={`Stop ${pkg.name}`} disabled={!canControl} onClick={() => begin('stop')}>
          Stop
        </button>
      ) : (
        <button type="button" aria-label={`Start ${pkg.name}`} disabled={!canControl} onClick={() => begin('start')}>
          Start
        </button>
      )}
      <button type="button" aria-label={`Uninstall ${pkg.name}`} disabled={busy} onClick={() => begin('uninstall')}>
        Uninstall
      </button>
      {flow && <FlowDialog pkg={pkg} flow={flow} values={values} onValues={setValues} onClose={close} onRun={run} />}
      {upgrading && upgrade && (
        <UpgradeFlow
          entry={upgrade}
          installed={{ name: pkg.name, version: pkg.version }}
          onClose={() => {
            setUpgrading(false);
            onUpgraded();
          }}
        />
      )}
    </div>
  );
}

function FlowDialog({
  pkg,
  flow,
  values,
  onValues,
  onClose,
  onRun,
}: {
  pkg: ActionPackage;
  flow: Flow;
  values: WizardValues;
  onValues: (v: WizardValues) => void;
  onClose: () => void;
  onRun: (action: Action, wizard: WizardValues | null) => void;
}) {
  const closeButton = (
    <div class="buttons">
      <button type="button" class="primary" onClick={onClose}>
        Close
      </button>
    </div>
  );
  // A running action cannot be called back; the dialog stays until it ends.
  const ignore = () => {};
  switch (flow.kind) {
    case 'checking':
    case 'running':
      return (
        <Dialog title={`${kVerbs[flow.action].label} ${pkg.name}`} onClose={ignore}>
          <p role="status">{flow.kind === 'checking' ? 'Checking whether this is allowed…' : `${kVerbs[flow.action].doing} ${pkg.name}…`}</p>
        </Dialog>
      );
    case 'refused':
      return (
        <Dialog title={`${kVerbs[flow.action].failed} ${pkg.name}`} onClose={onClose}>
          {flow.reasons.length > 0 ? (
            <>
              <p role="alert">The appliance does not allow this now:</p>
              <Reasons reasons={flow.reasons} />
            </>
          ) : (
            <ActionFailure error={flow.error} />
          )}
          {closeButton}
        </Dialog>
      );
    case 'failed':
      return (
        <Dialog title={`${kVerbs[flow.action].failed} ${pkg.name}`} onClose={onClose}>
          <ActionFailure error={flow.error} />
          {closeButton}
        </Dialog>
      );
    case 'confirm':
      return (
        <Dialog title={`${kVerbs[flow.action].label} ${pkg.name}?`} onClose={onClose}>
          <p>Please note before you go on:</p>
          <Reasons reasons={flow.reasons} />
          <div class="buttons">
            <button type="button" onClick={onClose}>
              Cancel
            </button>
            <button type="button" class="primary" onClick={() => onRun(flow.action, null)}>
              {kVerbs[flow.action].label} anyway
            </button>
          </div>
        </Dialog>
      );
    case 'uninstall':
      return (
        <Dialog title={`Uninstall ${pkg.name}`} onClose={onClose} wide={flow.wizard.length > 0}>
          <Steps
            pages={uninstallPages(pkg.name, flow.reasons, flow.wizard, values, onValues)}
            finishLabel="Uninstall"
            onFinish={() => onRun('uninstall', flow.wizard.length > 0 ? values : null)}
            onCancel={onClose}
          />
        </Dialog>
      );
  }
}
