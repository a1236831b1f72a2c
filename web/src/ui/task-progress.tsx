// A package task on the appliance (a download from a package server, with or
// without the install that follows) followed by polling its status. The task
// lives on the appliance, not in the page: any page that knows its id — the
// same page after a reload, a second tab — shows the same progress. Polling
// ends as soon as the task does, and with the component.

import './task-progress.css';
import { useEffect, useRef, useState } from 'preact/hooks';
import type { ApiFailure } from '../api/client';
import { messageFor } from '../api/messages';
import { DownloadCode } from '../api/codes';
import { useSession } from '../session';
import { ErrorText } from './error-text';
import { formatBytes } from './install-pages';
import { ProgressBar } from './progress';

const kPollMs = 500;

// The download task's "data" (docs/package-server.md), as "status" answers it.
export interface TaskData {
  id?: string;
  taskid?: string;
  status?: string;
  finished?: boolean;
  installing?: boolean;
  blqinst?: boolean;
  progress?: number | string;
  size?: number;
  // A download's failure is {code, message}; a failed install from a package
  // server adds the package tool's code ("result"). A job whose process died
  // reads as failed with the API code alone and the reason in "message". A
  // failed install from a file keeps its data as it started ("installing"
  // true): its task is finished, or no longer installing in the catalogue,
  // while its status still says installing (the install's own answer says
  // why).
  error?: { code?: number; message?: string; result?: number } | number;
  message?: string;
  signature?: string;
  feed?: string;
  origin?: string;
}

// How a followed task ended: `done` with its last data; `gone` when it was
// no longer there (another page read its end first); `failed` with the
// reason in words (and the package tool's code, when the install refused);
// `cancelled` by this page.
export type TaskEnd =
  | { kind: 'done'; data: TaskData }
  | { kind: 'gone' }
  | { kind: 'failed'; text: string; result?: number }
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

// The reason a task failed, in words, or null when it did not fail.
export function taskFailure(data: TaskData): string | null {
  const { error } = data;
  if (typeof error === 'number') return messageFor({ code: error, errors: data.message ? { message: data.message } : undefined });
  if (error && typeof error === 'object') {
    const known = error.code !== undefined ? kDownloadProblems[error.code] : undefined;
    const summary = known ?? `The download failed (error ${error.code ?? 'unknown'}).`;
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
    const result = typeof data.error === 'object' ? data.error.result : undefined;
    return { kind: 'failed', text: failure, result };
  }
  return data.status === undefined ? { kind: 'gone' } : { kind: 'done', data };
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
  const [data, setData] = useState<TaskData | null>(null);
  const [failure, setFailure] = useState<ApiFailure | null>(null);
  const [cancelling, setCancelling] = useState(false);
  const [attempt, setAttempt] = useState(0);
  const ended = useRef(onEnd);
  ended.current = onEnd;

  useEffect(() => {
    let stopped = false;
    let timer: ReturnType<typeof setTimeout> | undefined;
    const poll = async () => {
      const answer = await api.call<TaskData>('KIVO.Core.Package.Installation', 'status', 1, { task_id: taskId });
      if (stopped) return;
      if (!answer.ok) {
        // Not polled on: the user retries once the cause is seen to.
        setFailure(answer.error);
        return;
      }
      setFailure(null);
      setData(answer.data);
      if (answer.data.finished) ended.current(taskEnd(answer.data));
      else timer = setTimeout(poll, kPollMs);
    };
    void poll();
    return () => {
      stopped = true;
      clearTimeout(timer);
    };
  }, [api, taskId, attempt]);

  const cancel = async () => {
    setCancelling(true);
    const answer = await api.call('KIVO.Core.Package.Installation', 'cancel', 1, { taskid: taskId });
    setCancelling(false);
    if (answer.ok) ended.current({ kind: 'cancelled' });
    else setFailure(answer.error);
  };

  const progress = progressOf(data);
  const words = (data?.status && kStatusWords[data.status]) || 'Starting';
  return (
    <div class="task-progress">
      <ProgressBar label={`${words} ${name}${data ? amount(data, progress) : ''}`} value={progress} />
      {failure && (
        <>
          <ErrorText error={failure} />
          <button type="button" onClick={() => setAttempt(attempt + 1)}>
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
