// The install wizard for a package from a package server, opened once its
// file is downloaded: the appliance inspects the downloaded file ("Download"
// "check": licence, wizard pages) and checks the environment, the user goes
// through the shared install pages, and the install runs as a quick install
// (download and install in one worker on the appliance) with the wizard's
// answers, so it carries on whatever happens to this page. The quick
// install is one request, which takes the place of the downloaded file on
// the appliance: a page reloaded right after "Install" cannot leave the file
// dropped and the install never asked for.
//
// `ServerInstall` is the wizard as a dialog of its own (an install from the
// catalogue); `ServerInstallBody` is its content, for a flow that has its
// own dialog (an upgrade, ui/upgrade-flow.tsx).

import { useEffect, useRef, useState } from 'preact/hooks';
import type { ApiFailure } from '../api/client';
import { cancelTask, checkDownloaded, quickInstall, startedTaskId, type InstallValues } from '../api/installation';
import { entryPermissions } from '../api/permissions';
import type { ServerEntry } from '../api/server';
import { useSession } from '../session';
import { Dialog } from './dialog';
import { ErrorText } from './error-text';
import { CheckRefusal, checkEnvironment, InstallSteps, installParams, type InstallChoices, type PackageFacts, type Volume } from './install-pages';

// How the wizard ended: the install started (its task id, and the answers it
// was given), the download was dropped (by the appliance, which refused it,
// or by the user; `reason` in words when it was refused), or the download is
// kept for later.
export type InstallOutcome =
  | { kind: 'started'; taskId: string; values: InstallValues }
  | { kind: 'discarded'; reason?: string }
  | { kind: 'kept' };

type State =
  | { kind: 'checking' }
  | { kind: 'refused'; error: ApiFailure; downloadGone: boolean }
  | { kind: 'ready'; facts: PackageFacts; volumes: Volume[]; choices: InstallChoices };

// `switchOrigin`: the administrator has confirmed that the package,
// installed from elsewhere, comes from this entry's source from now on.
// `upgradeFrom`: the version installed now, when this install upgrades it.
export interface ServerInstallProps {
  entry: ServerEntry;
  taskId: string;
  switchOrigin?: boolean;
  upgradeFrom?: string;
  onClose: (outcome: InstallOutcome) => void;
}

export function ServerInstall(props: ServerInstallProps) {
  const name = props.entry.dname || props.entry.id;
  const [escapes, setEscapes] = useState(0);
  return (
    <Dialog title={`Install ${name}`} onClose={() => setEscapes((n) => n + 1)} wide>
      <ServerInstallBody {...props} closeRequests={escapes} />
    </Dialog>
  );
}

// `closeRequests` counts the dialog's Escape presses: each closes the
// wizard as its Cancel button does.
export function ServerInstallBody({
  entry,
  taskId,
  switchOrigin = false,
  upgradeFrom,
  onClose,
  closeRequests,
}: ServerInstallProps & { closeRequests: number }) {
  const { api } = useSession();
  const [state, setState] = useState<State>({ kind: 'checking' });
  const [busy, setBusy] = useState(false);
  const [failure, setFailure] = useState<ApiFailure | null>(null);
  const name = entry.dname || entry.id;
  const upgrade = upgradeFrom !== undefined;

  useEffect(() => {
    let stale = false;
    (async () => {
      const file = await checkDownloaded(api, taskId);
      if (stale) return;
      // A file the appliance refuses is deleted with its task right away.
      if (!file.ok) return setState({ kind: 'refused', error: file.error, downloadGone: true });
      const facts: PackageFacts = {
        id: file.data.id || entry.id,
        name: file.data.name || name,
        version: file.data.version ?? entry.version ?? '',
        licence: file.data.license,
        installPages: file.data.install_pages,
        replaces: upgradeFrom,
        // The checked file's own word; the catalogue's when the answer has none.
        permissions: file.data.permissions ?? entryPermissions(entry),
      };
      const environment = await checkEnvironment<{ volume_path?: string }>(api, facts, {
        id: facts.id,
        ver: facts.version,
        size: entry.size ?? 0,
        deppkgs: entry.deppkgs,
        conflictpkgs: entry.conflictpkgs,
        depsers: entry.install_dep_services,
        // The check refuses whenever packages that need this one run. An
        // upgrade goes on beside them as long as the new version still
        // suits them, which only the package tool judges, at the install.
        blCheckDep: upgrade ? false : undefined,
      });
      if (stale) return;
      if (!environment.ok) return setState({ kind: 'refused', error: environment.error, downloadGone: false });
      setState({ kind: 'ready', facts, volumes: environment.data.volumes, choices: environment.data.choices });
    })();
    return () => {
      stale = true;
    };
  }, [api, entry, taskId, name, upgrade, upgradeFrom]);

  const install = async (facts: PackageFacts, chosen: InstallChoices) => {
    setBusy(true);
    setFailure(null);
    const values = installParams(facts, chosen);
    const started = await quickInstall(api, entry, values, { switchOrigin });
    setBusy(false);
    if (!started.ok) return setFailure(started.error);
    onClose({ kind: 'started', taskId: startedTaskId(started.data, entry.id), values });
  };

  // Closing keeps the download for a later try, unless it is gone already
  // or the appliance refused the install (then it is of no use).
  const close = async () => {
    if (state.kind === 'refused' && state.downloadGone) return onClose({ kind: 'discarded' });
    if (state.kind === 'refused') {
      const dropping = await cancelTask(api, taskId);
      return onClose(dropping.ok ? { kind: 'discarded' } : { kind: 'kept' });
    }
    onClose({ kind: 'kept' });
  };

  const closing = useRef(close);
  closing.current = close;
  useEffect(() => {
    if (closeRequests > 0) void closing.current();
  }, [closeRequests]);

  const version = state.kind === 'ready' ? state.facts.version : (entry.version ?? '');
  return (
    <>
      {state.kind === 'checking' && <p class="loading">Checking the downloaded package…</p>}
      {state.kind === 'refused' && (
        <>
          <p>
            The appliance does not {upgrade ? 'upgrade' : 'install'} {name} {version} now:
          </p>
          <CheckRefusal error={state.error} />
          <div class="buttons">
            <button type="button" class="primary" onClick={() => void close()}>
              Close
            </button>
          </div>
        </>
      )}
      {state.kind === 'ready' && (
        <>
          <p class="hint">{upgrade ? `${name} is started again once the new version is in place.` : 'The package starts once it is installed.'}</p>
          <InstallSteps
            facts={state.facts}
            volumes={state.volumes}
            start={state.choices}
            busy={busy}
            finishLabel={upgrade ? 'Upgrade' : 'Install'}
            onFinish={(chosen) => void install(state.facts, chosen)}
            onCancel={() => void close()}
          />
          <ErrorText error={failure} />
        </>
      )}
    </>
  );
}
