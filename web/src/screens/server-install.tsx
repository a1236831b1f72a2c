// The install wizard for a package from a package server, opened once its
// file is downloaded: the appliance inspects the downloaded file ("Download"
// "check": licence, wizard pages) and checks the environment, the user goes
// through the shared install pages, and the install runs as a quick install
// (download and install in one worker on the appliance) with the wizard's
// answers, so it carries on whatever happens to this page.

import { useEffect, useState } from 'preact/hooks';
import type { ApiFailure } from '../api/client';
import { entryLink, type ServerEntry } from './catalogue';
import { useSession } from '../session';
import { Dialog } from '../ui/dialog';
import { ErrorText } from '../ui/error-text';
import {
  CheckRefusal,
  checkEnvironment,
  installPages,
  installParams,
  type InstallChoices,
  type PackageFacts,
  type Volume,
} from '../ui/install-pages';
import { Steps } from '../ui/steps';
import type { TaskData } from '../ui/task-progress';

// How the wizard ended: the install started (its task id), the download
// was dropped (by the appliance, which refused it, or by the user; `reason`
// in words when it was refused), or the download is kept for later.
export type InstallOutcome = { kind: 'started'; taskId: string } | { kind: 'discarded'; reason?: string } | { kind: 'kept' };

// What "Installation" "install" with a name answers: a new task's id, or for
// a download already under way that task's data.
export function startedTaskId(answer: { taskid?: string; data?: TaskData }, id: string): string {
  return answer.taskid ?? answer.data?.taskid ?? `@KIVOPKG_DOWNLOAD_${id}`;
}

// What "Download" "check" says about the downloaded file.
interface DownloadedFile {
  id: string;
  name?: string;
  version?: string;
  install_pages?: string;
  license?: string;
}

type State =
  | { kind: 'checking' }
  | { kind: 'refused'; error: ApiFailure; downloadGone: boolean }
  | { kind: 'ready'; facts: PackageFacts; volumes: Volume[] };

// With `switchOrigin`, the administrator has confirmed that the package,
// installed from elsewhere, comes from this entry's source from now on.
export function ServerInstall({
  entry,
  taskId,
  switchOrigin = false,
  onClose,
}: {
  entry: ServerEntry;
  taskId: string;
  switchOrigin?: boolean;
  onClose: (outcome: InstallOutcome) => void;
}) {
  const { api } = useSession();
  const [state, setState] = useState<State>({ kind: 'checking' });
  const [choices, setChoices] = useState<InstallChoices | null>(null);
  const [busy, setBusy] = useState(false);
  const [failure, setFailure] = useState<ApiFailure | null>(null);
  // Set once the download was dropped to make way for the install.
  const [dropped, setDropped] = useState(false);
  const name = entry.dname || entry.id;

  useEffect(() => {
    let stale = false;
    (async () => {
      const file = await api.call<DownloadedFile>('KIVO.Core.Package.Installation.Download', 'check', 1, { taskid: taskId });
      if (stale) return;
      // A file the appliance refuses is deleted with its task right away.
      if (!file.ok) return setState({ kind: 'refused', error: file.error, downloadGone: true });
      const facts: PackageFacts = {
        id: file.data.id || entry.id,
        name: file.data.name || name,
        version: file.data.version ?? entry.version ?? '',
        licence: file.data.license,
        installPages: file.data.install_pages,
      };
      const environment = await checkEnvironment<{ volume_path?: string }>(api, facts, {
        id: facts.id,
        ver: facts.version,
        size: entry.size ?? 0,
        deppkgs: entry.deppkgs,
        conflictpkgs: entry.conflictpkgs,
        depsers: entry.install_dep_services,
      });
      if (stale) return;
      if (!environment.ok) return setState({ kind: 'refused', error: environment.error, downloadGone: false });
      setChoices(environment.data.choices);
      setState({ kind: 'ready', facts, volumes: environment.data.volumes });
    })();
    return () => {
      stale = true;
    };
  }, [api, entry, taskId, name]);

  // The file fetched for the wizard goes first, so no download folder is
  // left behind; the quick install fetches the package again in a worker
  // that outlives this page and carries the wizard's answers.
  const install = async (facts: PackageFacts, chosen: InstallChoices) => {
    setBusy(true);
    setFailure(null);
    if (!dropped) {
      const dropping = await api.call('KIVO.Core.Package.Installation', 'cancel', 1, { taskid: taskId });
      if (!dropping.ok) {
        setBusy(false);
        return setFailure(dropping.error);
      }
      setDropped(true);
    }
    const params = installParams(facts, chosen);
    const started = await api.call<{ taskid?: string; data?: TaskData }>('KIVO.Core.Package.Installation', 'install', 1, {
      name: entry.id,
      is_kivo: entry.source === 'kivo',
      blqinst: true,
      installrunpackage: true,
      volume_path: params.volume_path,
      customuivalues: params.extra_values,
      ...(switchOrigin ? { ...entryLink(entry), switch_origin: true } : {}),
    });
    setBusy(false);
    if (!started.ok) return setFailure(started.error);
    onClose({ kind: 'started', taskId: startedTaskId(started.data, entry.id) });
  };

  // Closing keeps the download for a later try, unless it is gone already
  // or the appliance refused the install (then it is of no use).
  const close = async () => {
    if (dropped || (state.kind === 'refused' && state.downloadGone)) return onClose({ kind: 'discarded' });
    if (state.kind === 'refused') {
      const dropping = await api.call('KIVO.Core.Package.Installation', 'cancel', 1, { taskid: taskId });
      return onClose(dropping.ok ? { kind: 'discarded' } : { kind: 'kept' });
    }
    onClose({ kind: 'kept' });
  };

  return (
    <Dialog title={`Install ${name}`} onClose={() => void close()} wide>
      {state.kind === 'checking' && <p class="loading">Checking the downloaded package…</p>}
      {state.kind === 'refused' && (
        <>
          <p>{name} cannot be installed on this appliance.</p>
          <CheckRefusal error={state.error} />
          <div class="buttons">
            <button type="button" class="primary" onClick={() => void close()}>
              Close
            </button>
          </div>
        </>
      )}
      {state.kind === 'ready' && choices && (
        <>
          <p class="hint">The package starts once it is installed.</p>
          <Steps
            pages={installPages(state.facts, state.volumes, choices, setChoices)}
            finishLabel="Install"
            onFinish={() => void install(state.facts, choices)}
            onCancel={() => void close()}
            busy={busy}
          />
          <ErrorText error={failure} />
        </>
      )}
    </Dialog>
  );
}
