// "KIVO.Core.Package.Usage" (docs/http-api.md): what each installed package
// uses now, read from its control group, and the limits it has. A figure the
// appliance could not read comes with the reason instead of a number. Each
// package also carries how it is confined, as its scripts last recorded it.

import type { Api, Result } from './client';

const kUsage = 'KIVO.Core.Package.Usage';

export type UsageFigure = { measured: true; value: number } | { measured: false; reason: string };

// The package's confinement record (docs/package-tool.md, "What was applied").
export interface Confinement {
  user: string;
  uid: number;
  gid: number;
  root: boolean;
  landlock_abi?: number;
  applied: string[];
  missing: { what: string; reason: string }[];
  // 'confined' | 'partly' | 'no_account' | 'root' | 'turned_off'; kept open,
  // so that a state the page does not know is shown as not known.
  state?: string;
}

export interface PackageUsage {
  id: string;
  cpu_ns: UsageFigure;
  memory_bytes: UsageFigure;
  memory_limit_bytes: UsageFigure;
  process_limit: UsageFigure;
  // null: no record yet (a package installed before packages had accounts).
  confinement: Confinement | null;
}

// Every installed package's usage, by id.
export async function packageUsages(api: Api): Promise<Result<Map<string, PackageUsage>>> {
  const answer = await api.call<{ packages: PackageUsage[] }>(kUsage, 'list', 1);
  if (!answer.ok) return answer;
  return { ok: true, data: new Map(answer.data.packages.map((p) => [p.id, p])) };
}
