// "KIVO.Core.Package.Revision" (docs/http-api.md): the earlier version an
// upgrade kept of a package, rolling back to it and dropping it, and the
// version an automatic update failed to install.

import type { Api, Result } from './client';

const kRevision = 'KIVO.Core.Package.Revision';

// A kept earlier version: when it was replaced (seconds since the epoch)
// and the room its data copy and payload take.
export interface KeptVersion {
  version: string;
  replaced: number;
  bytes: number;
}

// A rollback's task data: under way, or how it ended (times in ms).
export interface Rollback {
  state: 'running' | 'success' | 'failure';
  from_version: string;
  to_version: string;
  started: number;
  ended?: number;
  version?: string;
  message?: string;
  code?: number;
}

// A version an automatic update failed to install and will not try again
// (nor any older one); `code` is the package tool's.
export interface AutoUpdateFailure {
  version: string;
  time: number;
  code: number;
  reason: string;
}

export interface PackageRevisions {
  id: string;
  version: string;
  kept: KeptVersion[];
  rollback?: Rollback;
  autoupdate_failure?: AutoUpdateFailure;
}

// Sent so that they outlive the page (`keepalive`): a rollback asked for
// just before a reload still starts.
const kOutlivesPage = true;

export async function packageRevisions(api: Api, id: string): Promise<Result<PackageRevisions>> {
  const answer = await api.call<{ packages: PackageRevisions[] }>(kRevision, 'list', 1, { id });
  if (!answer.ok) return answer;
  const found = answer.data.packages.find((p) => p.id === id);
  return found ? { ok: true, data: found } : { ok: true, data: { id, version: '', kept: [] } };
}

export function rollBack(api: Api, id: string): Promise<Result<{ task_id: string; rollback: Rollback }>> {
  return api.call(kRevision, 'rollback', 1, { id }, kOutlivesPage);
}

export function dropKeptVersions(api: Api, id: string): Promise<Result<{ message: string }>> {
  return api.call(kRevision, 'drop', 1, { id }, kOutlivesPage);
}
