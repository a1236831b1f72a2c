// A package task on the appliance (a download from a package server, with or
// without the install that follows) followed by polling its status. The task
// lives on the appliance, not in the page: any page that knows its id — the
// same page after a reload, a second tab — shows the same progress. Polling
// ends as soon as the task does, and with the component.

import './task-progress.css';
import { useCallback, useEffect, useRef, useState } from 'preact/hooks';
import { lastInstall } from '../api/activity';
import type { Api, ApiFailure, Result } from '../api/client';
import { messageFor } from '../api/messages';
import { DownloadCode, PackageCode, ToolCode } from '../api/codes';
import { cancelTask, kDownloadTaskPrefix, taskStatus, type TaskData } from '../api/installation';
import { useSession } from '../session';
import { ErrorText } from './error-text';
import { formatBytes } from './install-pages';
import { usePoll } from './poll';
import { ProgressBar } from './progress';

const kPollMs = 500;
// Status questions in a row that may bring no answer before the card says
// so: the task goes on on the appliance whatever the page heard.
const kMissesRetried = 5;

// How a followed task ended: `done` with its last data; `gone` when it was
// no longer there and nothing on record says how it ended; `failed` with the
// reason in words (and the package tool's code and own words, when the
// install refused, with the running package an upgrade would break);
// `cancelled` by this page.
export type TaskEnd =
  | { kind: 'done'; data: TaskData }
  | { kind: 'gone' }
  | { kind: 'failed'; text: string; result?: number; dependent?: string; message?: string }
  | { kind: 'cancelled' };

// Words for the download worker's own error codes (not API codes).
const kDownloadProblems: Record<number, string> = {
  [DownloadCode.Network]: 'The package server could not be reached, or the connection broke off.',
  [DownloadCode.Http]: 'The package server refused the download.',
  [DownloadCode.TooLarge]: 'The package server sent more than the catalogue announced.',
  [DownloadCode.Checksum]: 'The downloaded file is not the one the catalogue describes (its checksum differs).',
  [DownloadCode.Disk]: 'The downloaded file could not be stored on the volume.',
  [DownloadCode.Install]: 'The package could not be installed.',
  [DownloadCode.Request]: 'The catalogue gives no usable address for this package, or no folder could be made for it.',
};

const kDependentsBlock = 'The upgrade was not made: a running package needs the version installed now. It can go ahead while that package is stopped.';

// The reason a task failed, in words, or null when it did not fail.
export function taskFailure(data: TaskData): string | null {
  const { error } = data;
  if (typeof error === 'number') return messageFor({ code: error, errors: data.message ? { message: data.message } : undefined });
  if (error && typeof error === 'object') {
    const known = error.code !== undefined ? kDownloadProblems[error.code] : undefined;
    // A temporary block, not a package that cannot be installed.
    const blocked = error.result === ToolCode.DependentsRunning ? kDependentsBlock : undefined;
    const summary = blocked ?? known ?? `The download failed (error ${error.code ?? 'unknown'}).`;
    return error.message ? `${summary} ${error.message}` : summary;
  }
  if (installEndedUnfinished(data)) return 'The install did not complete.';
  return data.status === 'failed' ? 'The download failed.' : null;
}

// An install from a file that ended without success: a successful one
// removes its task, so a task whose status still says installing is over
// only when it failed.
function installEndedUnfinished(data: TaskData): boolean {
  const installStatus = data.status === 'installing' || data.status === 'upgrading';
  return installStatus && !data.blqinst && (data.finished === true || data.installing === false);
}

export function taskEnd(data: TaskData): TaskEnd {
  const failure = taskFailure(data);
  if (failure !== null) {
    const error = typeof data.error === 'object' ? data.error : undefined;
    return { kind: 'failed', text: failure, result: error?.result, dependent: error?.deppkg, message: error?.message };
  }
  return data.status === undefined ? { kind: 'gone' } : { kind: 'done', data };
}

// The end of a task that another reader took first. The appliance drops a
// failed download's task on the first status read that sees the failure
// (and a quick install's on its end), so a second reader (another page, a
// question repeated after a lost answer) only learns that it is gone. Every
// install through the appliance is on record in the activity log before its
// task exists and is ended there before its task reads as finished, so the
// newest install of the package on record is this task's.
async function endOnRecord(api: Api, taskId: string): Promise<TaskEnd> {
  if (!taskId.startsWith(kDownloadTaskPrefix)) return { kind: 'gone' };
  const entry = await lastInstall(api, taskId.slice(kDownloadTaskPrefix.length));
  if (entry?.state === 'failure') {
    if (entry.code === PackageCode.Cancelled) return { kind: 'cancelled' };
    const text = taskFailure({ error: { code: entry.code ?? undefined, message: entry.words || undefined } });
    return { kind: 'failed', text: text ?? 'The download failed.' };
  }
  if (entry?.state === 'success' && entry.words === 'installed') return { kind: 'done', data: { status: 'installed', finished: true } };
  return { kind: 'gone' };
}

const kStatusWords: Record<string, string> = {
  downloading: 'Downloading',
  downloaded: 'Downloaded',
  installing: 'Installing',
  upgrading: 'Upgrading',
  installed: 'Installed',
};

function progressOf(data: TaskData | null): number | null {
  const value = Number(data?.progress);
  return data && Number.isFinite(value) ? value : null;
}

function amount(data: TaskData, progress: number | null): string {
  if (data.installing || !data.size || progress === null) return '';
  return ` (${formatBytes(Math.round(data.size * progress))} of ${formatBytes(data.size)})`;
}

// The task's data as last answered: a failed status leaves it shown.
function useLastData(result: Result<TaskData> | null): TaskData | null {
  const last = useRef<TaskData | null>(null);
  if (result?.ok) last.current = result.data;
  return last.current;
}

export function TaskProgress({
  taskId,
  name,
  onEnd,
}: {
  taskId: string;
  // The package's name, for the labels.
  name: string;
  onEnd: (end: TaskEnd) => void;
}) {
  const { api } = useSession();
  const load = useCallback(() => taskStatus(api, taskId), [api, taskId]);
  // A status that failed with an answer (the session ended, the task is not
  // this account's) is not asked again: the user retries ("Check again")
  // once the cause is seen to.
  const { result, reload, retrying } = usePoll(load, {
    everyMs: kPollMs,
    again: (r) => r.ok && !r.data.finished,
    missesRetried: kMissesRetried,
  });
  const data = useLastData(result);
  const [cancelFailure, setCancelFailure] = useState<ApiFailure | null>(null);
  const [cancelling, setCancelling] = useState(false);
  const ended = useRef(onEnd);
  ended.current = onEnd;

  useEffect(() => {
    if (!result?.ok) return;
    setCancelFailure(null);
    if (!result.data.finished) return;
    const end = taskEnd(result.data);
    if (end.kind !== 'gone') return ended.current(end);
    let live = true;
    void endOnRecord(api, taskId).then((recorded) => {
      if (live) ended.current(recorded);
    });
    return () => {
      live = false;
    };
  }, [result, api, taskId]);

  const cancel = async () => {
    setCancelling(true);
    const answer = await cancelTask(api, taskId);
    setCancelling(false);
    if (answer.ok) ended.current({ kind: 'cancelled' });
    else setCancelFailure(answer.error);
  };

  const failure = cancelFailure ?? (result && !result.ok && !retrying ? result.error : null);
  const progress = progressOf(data);
  const words = (data?.status && kStatusWords[data.status]) || 'Starting';
  return (
    <div class="task-progress">
      <ProgressBar label={`${words} ${name}${data ? amount(data, progress) : ''}`} value={progress} />
      {failure && (
        <>
          <ErrorText error={failure} />
          <button type="button" onClick={() => void reload()}>
            Check again
          </button>
        </>
      )}
      {!data?.installing && (
        <button type="button" onClick={cancel} disabled={cancelling}>
          {cancelling ? 'Cancelling…' : 'Cancel'}
        </button>
      )}
    </div>
  );
}
