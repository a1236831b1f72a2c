import './manual-install.css';
import { useCallback, useEffect, useRef, useState } from 'preact/hooks';
import type { Api, ApiFailure, Result } from '../api/client';
import { PackageCode } from '../api/codes';
import {
  cleanUpload,
  downloadTaskId,
  installUploaded,
  taskStatus,
  uploadPackage,
  type InstallAllowances,
  type InstallAnswer,
  type UploadAnswer,
} from '../api/installation';
import { messageFor } from '../api/messages';
import { getPackage } from '../api/package';
import { getSettings } from '../api/setting';
import { useSession } from '../session';
import { routeHref } from '../route';
import { Dialog } from '../ui/dialog';
import { OriginSwitch } from '../ui/origin-switch';
import { ErrorText } from '../ui/error-text';
import { usePoll } from '../ui/poll';
import { ProgressBar } from '../ui/progress';
import { ReleaseNotes } from '../ui/release-notes';
import type { StepPage } from '../ui/steps';
import { CheckRefusal, checkEnvironment, InstallSteps, installParams, type InstallChoices, type PackageFacts, type Volume } from '../ui/install-pages';

// Manual install: the administrator picks a package file, which is uploaded
// and inspected by the appliance; the environment check runs; the wizard asks
// for what the install needs (signature confirmation, licence, the package's
// own pages, volume); the install runs with its progress polled. The uploaded
// file lives on the appliance behind an upload task until the install takes
// it, so every way out of the wizard other than a successful install asks the
// appliance to clean it up.

const kPollMs = 500;

interface CheckAnswer {
  volume_path?: string;
  is_occupied?: boolean;
}

// The trust level at which no confirmation lets an unverified package in
// ("Trusted publishers only", docs/package-tool.md).
const kStrictestTrustLevel = 0;

interface Prepared {
  upload: UploadAnswer;
  // The appliance's trust level when the signature could not be verified;
  // null when it is not needed or could not be read (the appliance decides
  // at the install either way).
  trustLevel: number | null;
  facts: PackageFacts;
  volumes: Volume[];
  busy: boolean;
  defaultVolumeError: ApiFailure | null;
  initial: InstallChoices;
}

type Phase =
  | { kind: 'idle' }
  | { kind: 'uploading'; file: File; sent: number; total: number }
  | { kind: 'checking'; file: File }
  | { kind: 'refused'; file: File; error: ApiFailure }
  | { kind: 'wizard'; prepared: Prepared; choices: InstallChoices }
  | { kind: 'installing'; prepared: Prepared; choices: InstallChoices; progress: number | null }
  | {
      kind: 'done';
      prepared: Prepared;
      choices: InstallChoices;
      trustUnverified: boolean;
      allowed: InstallAllowances;
      outcome: Result<InstallAnswer>;
      status: string | null;
    };

// What the check needs to know about the package, from the upload's answer.
// `upgrade`: the package is installed, in another version. The check then
// does not refuse for the running packages that need it: whether the new
// version still suits them, the package tool judges at the install.
function checkParams(upload: UploadAnswer, upgrade: boolean) {
  const extra = upload.additional ?? {};
  const deps = extra.dependent_packages;
  const services = Array.isArray(extra.start_dependent_services) ? extra.start_dependent_services.filter((s) => typeof s === 'string') : [];
  return {
    id: upload.id,
    ver: upload.version,
    deppkgs: typeof deps === 'object' && deps !== null && Object.keys(deps).length > 0 ? deps : undefined,
    depsers: services.length > 0 ? services.join(':') : undefined,
    install_type: typeof extra.install_type === 'string' ? extra.install_type : undefined,
    blCheckDep: upgrade ? false : undefined,
  };
}

async function prepare(api: Api, upload: UploadAnswer): Promise<Result<Prepared>> {
  const installed = await getPackage(api, upload.id, []);
  const facts: PackageFacts = {
    id: upload.id,
    name: upload.name,
    version: upload.version,
    licence: upload.licence,
    installPages: upload.install_pages,
    replaces: installed.ok ? installed.data.version : undefined,
    permissions: upload.permissions,
  };
  const environment = await checkEnvironment<CheckAnswer>(api, facts, checkParams(upload, installed.ok));
  if (!environment.ok) return environment;
  const { answer, volumes, choices, defaultVolumeError } = environment.data;
  const trustLevel = upload.codesign_error !== undefined ? await readTrustLevel(api) : null;
  // A package from a file starts once installed unless the user says not to,
  // as one from a package server does.
  const initial = { ...choices, startAfter: true };
  return { ok: true, data: { upload, trustLevel, facts, volumes, busy: answer.is_occupied === true, defaultVolumeError, initial } };
}

async function readTrustLevel(api: Api): Promise<number | null> {
  const settings = await getSettings(api);
  return settings.ok && typeof settings.data.trust_level === 'number' ? settings.data.trust_level : null;
}

function workerMessages(answer: InstallAnswer): string[] {
  const lines = answer.worker_message;
  return Array.isArray(lines) ? lines.filter((l): l is string => typeof l === 'string' && l.trim() !== '') : [];
}

function codesignPage(prepared: Prepared, confirmed: boolean, onConfirm: (yes: boolean) => void): StepPage {
  const { upload } = prepared;
  const code = upload.codesign_error ?? 0;
  if (prepared.trustLevel === kStrictestTrustLevel) return trustLevelRefusalPage(upload);
  return {
    title: 'Signature',
    body: (
      <div class="codesign-warning">
        <p class="warning">
          <strong>This package's signature could not be verified.</strong> {messageFor({ code })}
        </p>
        {upload.codesign_message && <p>The package tool says: {upload.codesign_message}</p>}
        <p>Its contents may have been changed, or it comes from a publisher this appliance does not know. Install it only if you trust where it came from.</p>
        <label class="choice">
          <input type="checkbox" checked={confirmed} onChange={(e) => onConfirm(e.currentTarget.checked)} /> Install it anyway
        </label>
      </div>
    ),
    problem: confirmed ? null : 'Confirm that you want to install a package whose signature could not be verified.',
  };
}

// At "Trusted publishers only" the appliance installs no package whose
// signature could not be verified, whatever anyone confirms: say so, and
// where the level is changed, instead of offering "Install it anyway".
function trustLevelRefusalPage(upload: UploadAnswer): StepPage {
  return {
    title: 'Signature',
    body: (
      <div class="codesign-warning">
        <p class="warning">
          <strong>This package's signature could not be verified.</strong> {messageFor({ code: upload.codesign_error ?? 0 })}
        </p>
        {upload.codesign_message && <p>The package tool says: {upload.codesign_message}</p>}
        <p>
          This appliance installs only packages signed by a trusted publisher (trust level “Trusted publishers only”), so it
          cannot install this one. To install it, an administrator must first choose a trust level that allows it, then
          upload the package again.
        </p>
        <p>
          <a href={routeHref({ screen: 'settings' })}>Change the trust level in Settings</a>
        </p>
      </div>
    ),
    problem: 'The trust level of this appliance does not allow this package.',
  };
}

// Before a manual upgrade, the file's release notes, when it has them.
function releaseNotesPage({ upload, facts }: Prepared): StepPage[] {
  if (facts.replaces === undefined || !upload.changelog?.trim()) return [];
  return [{ title: 'Release notes', body: <ReleaseNotes version={upload.version} notes={upload.changelog} /> }];
}

function InstallWizard({
  prepared,
  start,
  onInstall,
  onCancel,
}: {
  prepared: Prepared;
  start: InstallChoices;
  onInstall: (choices: InstallChoices, trustUnverified: boolean) => void;
  onCancel: () => void;
}) {
  const [trustUnverified, setTrustUnverified] = useState(false);
  const unverified = prepared.upload.codesign_error !== undefined;
  const before = [...releaseNotesPage(prepared), ...(unverified ? [codesignPage(prepared, trustUnverified, setTrustUnverified)] : [])];
  return (
    <>
      {prepared.busy && <p class="hint">Another package operation is under way; the install may have to wait for it.</p>}
      {prepared.defaultVolumeError && (
        <div>
          <p class="hint">The default install volume could not be read:</p>
          <ErrorText error={prepared.defaultVolumeError} />
        </div>
      )}
      <InstallSteps
        facts={prepared.facts}
        volumes={prepared.volumes}
        start={start}
        before={before}
        onFinish={(choices) => onInstall(choices, trustUnverified)}
        onCancel={onCancel}
      />
    </>
  );
}

// The package's state as the list reports it; null when it cannot be read
// or the package has no service to run.
async function statusOf(api: Api, id: string): Promise<string | null> {
  const got = await getPackage<{ status?: string; startable?: boolean }>(api, id, ['status', 'startable']);
  if (!got.ok || got.data.additional?.startable === false) return null;
  return got.data.additional?.status ?? null;
}

// `status`: the state read after an install asked to start it.
function InstallOutcome({ prepared, outcome, status }: { prepared: Prepared; outcome: Result<InstallAnswer>; status: string | null }) {
  const name = prepared.facts.name || prepared.facts.id;
  if (!outcome.ok) {
    return (
      <>
        <p>
          {name} {prepared.facts.version} was not installed.
        </p>
        <CheckRefusal error={outcome.error} />
      </>
    );
  }
  const lines = workerMessages(outcome.data);
  return (
    <>
      <p class="installed-note" role="status">
        {name} {prepared.facts.version} is installed{status === null ? '' : status === 'running' ? ' and running' : ', but it does not run'}.{' '}
        <a href={routeHref({ screen: 'package', id: prepared.facts.id })}>Show the package</a>
      </p>
      {lines.length > 0 && <MessageList lines={lines} />}
    </>
  );
}

function MessageList({ lines }: { lines: string[] }) {
  return (
    <>
      <h3>Messages from the package</h3>
      <ul class="worker-messages">
        {lines.map((l, i) => (
          <li key={i}>{l}</li>
        ))}
      </ul>
    </>
  );
}

// Polls the install task's progress while `active`, reporting each progress
// the task gives; a status that fails is asked again all the same.
function useInstallProgress(api: Api, packageId: string, active: boolean, onProgress: (value: number) => void) {
  const load = useCallback(() => taskStatus(api, downloadTaskId(packageId)), [api, packageId]);
  const { result } = usePoll(load, { everyMs: kPollMs, again: () => true, active, waitFirst: true });
  const reported = useRef(onProgress);
  reported.current = onProgress;
  useEffect(() => {
    const progress = result?.ok ? result.data.progress : undefined;
    if (typeof progress === 'number') reported.current(progress);
  }, [result]);
}

function dialogTitle(phase: Phase): string {
  switch (phase.kind) {
    case 'uploading':
    case 'checking':
      return `Uploading ${phase.file.name}`;
    case 'refused':
      return `${phase.file.name} cannot be installed`;
    case 'idle':
      return '';
    default:
      return `Install ${phase.prepared.facts.name || phase.prepared.facts.id}`;
  }
}

export function ManualInstallScreen() {
  const { api } = useSession();
  const [file, setFile] = useState<File | null>(null);
  const [phase, setPhase] = useState<Phase>({ kind: 'idle' });
  const abort = useRef<AbortController | null>(null);
  // The upload task the appliance still keeps a file for; cleaned when the
  // user leaves the wizard, also by leaving the screen.
  const pendingUpload = useRef<string | null>(null);

  // Leaving the screen, reloading or closing the page abandons the wizard too.
  useEffect(() => {
    const leave = () => {
      abort.current?.abort();
      if (pendingUpload.current) cleanUpload(api, pendingUpload.current);
      pendingUpload.current = null;
    };
    addEventListener('pagehide', leave);
    return () => {
      removeEventListener('pagehide', leave);
      leave();
    };
  }, [api]);

  const installing = phase.kind === 'installing' ? phase : null;
  useInstallProgress(api, installing?.prepared.facts.id ?? '', installing !== null, (progress) =>
    setPhase((p) => (p.kind === 'installing' ? { ...p, progress } : p)),
  );

  const upload = async (chosen: File) => {
    const controller = new AbortController();
    abort.current = controller;
    setPhase({ kind: 'uploading', file: chosen, sent: 0, total: chosen.size });
    const answer = await uploadPackage(
      api,
      chosen,
      (sent, total) => setPhase((p) => (p.kind === 'uploading' ? { ...p, sent, total } : p)),
      controller.signal,
    );
    abort.current = null;
    if (controller.signal.aborted) return;
    if (!answer.ok) return setPhase({ kind: 'refused', file: chosen, error: answer.error });
    pendingUpload.current = answer.data.task_id;
    setPhase({ kind: 'checking', file: chosen });
    const prepared = await prepare(api, answer.data);
    if (prepared.ok) return setPhase({ kind: 'wizard', prepared: prepared.data, choices: prepared.data.initial });
    // The appliance is not ready for this package: nothing more will be done
    // with the upload.
    finishUpload();
    setPhase({ kind: 'refused', file: chosen, error: prepared.error });
  };

  const finishUpload = () => {
    if (pendingUpload.current) cleanUpload(api, pendingUpload.current);
    pendingUpload.current = null;
  };

  // `allowed`: what the administrator confirmed after a refusal: that the
  // package, which came from elsewhere, is from now on a file's installed
  // by hand; that it upgrades without a safety copy of its data.
  const install = async (prepared: Prepared, choices: InstallChoices, trustUnverified: boolean, allowed: InstallAllowances = {}) => {
    setPhase({ kind: 'installing', prepared, choices, progress: null });
    const options = { trustUnverified, ...allowed, start: choices.startAfter === true };
    const outcome = await installUploaded(api, prepared.upload.task_id, installParams(prepared.facts, choices), options);
    // A successful install took the file; a failed one leaves it for a retry.
    if (outcome.ok) pendingUpload.current = null;
    // Whether it runs is read back, not assumed from the request.
    const status = outcome.ok && options.start ? await statusOf(api, prepared.facts.id) : null;
    setPhase({ kind: 'done', prepared, choices, trustUnverified, allowed, outcome, status });
  };

  const close = () => {
    switch (phase.kind) {
      case 'uploading':
        abort.current?.abort();
        break;
      case 'checking':
      case 'installing':
        // The appliance is answering; an install under way cannot be stopped.
        return;
      default:
        finishUpload();
    }
    setPhase({ kind: 'idle' });
  };

  return (
    <section class="manual-install">
      <h1>Manual install</h1>
      <p class="hint">Install a package from a package file (.kpk) on this computer.</p>
      <form
        class="card upload-form"
        onSubmit={(e) => {
          e.preventDefault();
          if (file) void upload(file);
        }}
      >
        <div class="field">
          <label for="package-file">Package file</label>
          <input id="package-file" type="file" accept=".kpk" onChange={(e) => setFile(e.currentTarget.files?.[0] ?? null)} />
        </div>
        <div class="buttons">
          <button type="submit" class="primary" disabled={!file || phase.kind !== 'idle'}>
            Upload
          </button>
        </div>
      </form>
      {phase.kind !== 'idle' && (
        <Dialog title={dialogTitle(phase)} onClose={close} wide={phase.kind === 'wizard'}>
          <PhaseBody phase={phase} onClose={close} onInstall={install} onRetry={(prepared, choices) => setPhase({ kind: 'wizard', prepared, choices })} />
        </Dialog>
      )}
    </section>
  );
}

function PhaseBody({
  phase,
  onClose,
  onInstall,
  onRetry,
}: {
  phase: Phase;
  onClose: () => void;
  onInstall: (prepared: Prepared, choices: InstallChoices, trustUnverified: boolean, allowed?: InstallAllowances) => void;
  onRetry: (prepared: Prepared, choices: InstallChoices) => void;
}) {
  switch (phase.kind) {
    case 'uploading':
      return (
        <>
          <ProgressBar label="Uploading" value={phase.total > 0 ? phase.sent / phase.total : null} />
          <CloseButtons label="Cancel" onClose={onClose} />
        </>
      );
    case 'checking':
      return <ProgressBar label="Checking the package" value={null} />;
    case 'refused':
      return (
        <>
          <CheckRefusal error={phase.error} />
          <CloseButtons label="Close" onClose={onClose} />
        </>
      );
    case 'wizard':
      return <InstallWizard prepared={phase.prepared} start={phase.choices} onInstall={(c, t) => onInstall(phase.prepared, c, t)} onCancel={onClose} />;
    case 'installing':
      return (
        <>
          <ProgressBar label="Installing" value={phase.progress} />
          <p class="hint">An install under way cannot be stopped; it ends by itself.</p>
        </>
      );
    case 'done':
      if (!phase.outcome.ok && phase.outcome.error.code === PackageCode.OtherOrigin) {
        return (
          <>
            <CheckRefusal error={phase.outcome.error} />
            <OriginSwitch
              name={phase.prepared.facts.name || phase.prepared.facts.id}
              source="files installed by hand"
              onSwitch={() => onInstall(phase.prepared, phase.choices, phase.trustUnverified, { ...phase.allowed, switchOrigin: true })}
              onCancel={onClose}
            />
          </>
        );
      }
      if (!phase.outcome.ok && phase.outcome.error.code === PackageCode.NoRoomForDataCopy) {
        return (
          <>
            <CheckRefusal error={phase.outcome.error} />
            <p class="hint">
              Without the safety copy the upgrade is made all the same, but if it fails, the data it changed cannot be brought back.
            </p>
            <div class="buttons">
              <button type="button" onClick={onClose}>
                Close
              </button>
              <button
                type="button"
                class="primary"
                onClick={() => onInstall(phase.prepared, phase.choices, phase.trustUnverified, { ...phase.allowed, withoutDataCopy: true })}
              >
                Upgrade without a safety copy
              </button>
            </div>
          </>
        );
      }
      return (
        <>
          <InstallOutcome prepared={phase.prepared} outcome={phase.outcome} status={phase.status} />
          <div class="buttons">
            {!phase.outcome.ok && (
              <button type="button" onClick={() => onRetry(phase.prepared, phase.choices)}>
                Back to the wizard
              </button>
            )}
            <button type="button" class="primary" onClick={onClose}>
              Close
            </button>
          </div>
        </>
      );
    default:
      return null;
  }
}

function CloseButtons({ label, onClose }: { label: string; onClose: () => void }) {
  return (
    <div class="buttons">
      <button type="button" onClick={onClose}>
        {label}
      </button>
    </div>
  );
}
