// "KIVO.Core.Package.Watchdog" (docs/http-api.md): what the watchdog did to
// each installed package, the restarts of the last hour and whether it gave
// up on the package.

import type { Api, Result } from './client';

const kWatchdog = 'KIVO.Core.Package.Watchdog';

// The watchdog gave up on the package: when (ms since the epoch), after how
// many restarts, why, and the last lines of the package's own log.
export interface Crashed {
  time: number;
  restarts: number;
  reason: string;
  log: string;
}

export interface WatchdogView {
  id: string;
  restarts_last_hour: number;
  crashed: Crashed | null;
}

// Every installed package's view, by id.
export async function watchdogViews(api: Api): Promise<Result<Map<string, WatchdogView>>> {
  const answer = await api.call<{ packages: WatchdogView[] }>(kWatchdog, 'list', 1);
  if (!answer.ok) return answer;
  return { ok: true, data: new Map(answer.data.packages.map((p) => [p.id, p])) };
}
