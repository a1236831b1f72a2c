// "KIVO.Core.Package.Activity" (docs/activity.md): who changed what on the
// appliance, when, from where and how it ended. Administrators only.
// Every filter and number goes as text: the API reads them so and answers
// 120 naming any value out of its rules.

import type { Api, Result } from './client';

const kActivity = 'KIVO.Core.Package.Activity';

// "unfinished": the process doing the work is gone without ending it
// (killed, or crashed); "running": that process is still at work.
export type ActivityState = 'success' | 'failure' | 'unfinished' | 'running';

export interface ActivityEntry {
  id: number;
  // ms since the epoch; `ended` and `duration_ms` are null until it ends.
  started: number;
  ended: number | null;
  duration_ms: number | null;
  actor: string;
  origin: string;
  address: string;
  operation: string;
  target: Record<string, unknown>;
  packages: string[];
  state: ActivityState;
  code: number | null;
  words: string;
}

export interface ActivityPage {
  entries: ActivityEntry[];
  total: number;
  offset: number;
  limit: number;
}

// Each filter is optional; times are ms since the epoch, on the start.
export interface ActivityFilter {
  package?: string;
  account?: string;
  operation?: string;
  outcome?: ActivityState;
  since?: number;
  until?: number;
}

// The most entries the API gives in one page.
export const kMaxActivityPage = 500;

function filterParams(filter: ActivityFilter): Record<string, string | undefined> {
  const text = (v: string | undefined) => (v === undefined || v === '' ? undefined : v);
  const time = (v: number | undefined) => (v === undefined ? undefined : String(Math.max(0, Math.floor(v))));
  return {
    package: text(filter.package),
    account: text(filter.account),
    operation: text(filter.operation),
    outcome: text(filter.outcome),
    since: time(filter.since),
    until: time(filter.until),
  };
}

// The entries that match `filter`, newest first, `limit` of them from
// `offset` on.
export function listActivity(api: Api, filter: ActivityFilter, offset: number, limit: number): Promise<Result<ActivityPage>> {
  return api.call<ActivityPage>(kActivity, 'list', 1, { ...filterParams(filter), offset: String(offset), limit: String(limit) });
}

// The newest install of `packageId` on record, from a file or a package
// server, by any page or tool; null when there is none or the log cannot be
// read.
export async function lastInstall(api: Api, packageId: string): Promise<ActivityEntry | null> {
  const page = await listActivity(api, { package: packageId, operation: 'Installation.install' }, 0, 1);
  return page.ok ? (page.data.entries[0] ?? null) : null;
}

export type ExportFormat = 'csv' | 'json';

// Every entry that matches `filter`, as a file.
export function exportActivity(api: Api, filter: ActivityFilter, format: ExportFormat): Promise<Result<Blob>> {
  return api.download(kActivity, 'export', 1, { ...filterParams(filter), format });
}
