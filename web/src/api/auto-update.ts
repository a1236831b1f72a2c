// "KIVO.Core.Package.AutoUpdate" (docs/http-api.md): when automatic updates
// may run (the maintenance window, in the appliance's local time), which
// packages they leave alone (holds) and how the last run went.

import type { Api, Result } from './client';

const kAutoUpdate = 'KIVO.Core.Package.AutoUpdate';

export type Weekday = 'mon' | 'tue' | 'wed' | 'thu' | 'fri' | 'sat' | 'sun';
export const kWeekdays: { day: Weekday; label: string }[] = [
  { day: 'mon', label: 'Monday' },
  { day: 'tue', label: 'Tuesday' },
  { day: 'wed', label: 'Wednesday' },
  { day: 'thu', label: 'Thursday' },
  { day: 'fri', label: 'Friday' },
  { day: 'sat', label: 'Saturday' },
  { day: 'sun', label: 'Sunday' },
];

export interface UpdateWindow {
  limited: boolean;
  days: Weekday[];
  start: string; // "HH:MM"
  end: string; // "HH:MM"; at or before start: past midnight
  random_delay_minutes: number;
}

export interface UpdateHold {
  until: string | null; // "YYYY-MM-DD", or null until lifted
  since: number; // seconds since the epoch
  by: string;
  active: boolean;
}

export type Outcome = 'upgraded' | 'failed' | 'held' | 'failed-before' | 'up-to-date' | 'not-chosen' | 'skipped';

export interface PackageOutcome {
  outcome: Outcome;
  from: string;
  to: string;
  words: string;
}

export interface UpdateRun {
  started: number;
  ended: number;
  exit_status: number;
  packages: Record<string, PackageOutcome>;
}

export interface AutoUpdateState {
  mode: 'off' | 'all' | 'chosen';
  window: UpdateWindow;
  window_error: { key: string; reason: string } | null;
  holds: Record<string, UpdateHold>;
  last_run: UpdateRun | null;
  now: number;
  inside: boolean;
  already_ran: boolean;
  next_run: { opens: number; closes: number } | null;
}

export function getAutoUpdate(api: Api): Promise<Result<AutoUpdateState>> {
  return api.call<AutoUpdateState>(kAutoUpdate, 'get', 1);
}

// Stores the window whole; a bad part is refused with 120 naming it.
export function setUpdateWindow(api: Api, window: UpdateWindow): Promise<Result<AutoUpdateState>> {
  const params = window.limited
    ? { limited: true, days: window.days, start: window.start, end: window.end, random_delay_minutes: String(window.random_delay_minutes) }
    : { limited: false, random_delay_minutes: String(window.random_delay_minutes) };
  return api.call<AutoUpdateState>(kAutoUpdate, 'set', 1, params);
}

// Holds `id` until the day `until` begins ("YYYY-MM-DD"), or until lifted.
export function holdPackage(api: Api, id: string, until: string | null): Promise<Result<AutoUpdateState>> {
  return api.call<AutoUpdateState>(kAutoUpdate, 'hold', 1, until ? { id, until } : { id });
}

export function releasePackage(api: Api, id: string): Promise<Result<AutoUpdateState & { lifted: boolean }>> {
  return api.call<AutoUpdateState & { lifted: boolean }>(kAutoUpdate, 'release', 1, { id });
}

// A package's outcome in words, as a run reports it.
export const kOutcomeWords: Record<Outcome, string> = {
  upgraded: 'Upgraded',
  failed: 'Upgrade failed',
  held: 'Held',
  'failed-before': 'Waiting for a version newer than one that failed',
  'up-to-date': 'Up to date',
  'not-chosen': 'Not chosen for automatic updates',
  skipped: 'Skipped',
};
