// "KIVO.Core.Package" and its "Log" (docs/http-api.md): the installed
// packages, one package's details and log, and the feasibility check
// (docs/feasibility.md).

import type { Api, Result } from './client';

const kPackage = 'KIVO.Core.Package';
const kLog = 'KIVO.Core.Package.Log';

// An installed package as "list" and "get" answer it; `additional` holds the
// fields asked for, typed by the caller.
export interface PackageInfo<Additional> {
  id: string;
  name: string;
  version: string;
  additional?: Additional;
}

export function listPackages<Additional>(api: Api, additional: string[]): Promise<Result<{ packages: PackageInfo<Additional>[]; total: number }>> {
  return api.call<{ packages: PackageInfo<Additional>[]; total: number }>(kPackage, 'list', 1, { additional });
}

export function getPackage<Additional>(api: Api, id: string, additional: string[]): Promise<Result<PackageInfo<Additional>>> {
  return api.call<PackageInfo<Additional>>(kPackage, 'get', 1, { id, additional });
}

// Whether the appliance allows stopping or uninstalling `ids` now; a refusal
// says whether it is hard or soft, and why.
export function feasibilityCheck(api: Api, type: 'stop_check' | 'uninstall_check', ids: string[]): Promise<Result<unknown>> {
  return api.call(kPackage, 'feasibility_check', 1, { type, packages: ids });
}

export function packageLog(api: Api, id: string): Promise<Result<{ pkglog: string }>> {
  return api.call<{ pkglog: string }>(kLog, 'get', 1, { name: id });
}
