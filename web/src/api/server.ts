// "KIVO.Core.Package.Server" (docs/package-server.md): the catalogue of the
// vendor's package server or of the added feeds, with what the appliance
// knows about each package.

import type { Api, Result } from './client';
import type { TaskData } from './installation';

const kServer = 'KIVO.Core.Package.Server';

// An entry of "list": the server's own keys and the appliance's annotations.
export interface ServerEntry {
  id: string;
  version?: string;
  dname?: string;
  desc?: string;
  maintainer?: string;
  beta?: boolean;
  blupgrade?: boolean;
  // Set on a newer version of an installed package that came from elsewhere:
  // where it came from, in words. It is no upgrade unless the origin is
  // switched.
  other_origin?: string;
  source: 'kivo' | 'others';
  // On the feeds' side: the address of the feed that lists it.
  feed?: string;
  // The release notes of this version, plain text (shown as text only).
  changelog?: string;
  status?: string;
  info?: TaskData | null;
  icon?: string | null;
  link?: string;
  size?: number;
  deppkgs?: object;
  conflictpkgs?: object;
  install_dep_services?: string;
}

export interface ServerList {
  data: ServerEntry[];
  total: number;
  blupgrade: boolean;
  recommend?: ServerEntry[];
}

// The vendor's catalogue, or with `others` the added feeds' one; `reload`
// asks the servers again instead of the appliance's cache.
export function listCatalogue(api: Api, { reload, others }: { reload?: boolean; others?: boolean }): Promise<Result<ServerList>> {
  return api.call<ServerList>(kServer, 'list', 1, { blforcereload: reload, blloadothers: others });
}

// Tells the appliance the user has seen the upgrades, which refreshes its
// upgrade count on the desktop.
export function markUpgradesSeen(api: Api): Promise<Result<unknown>> {
  return api.call(kServer, 'check', 1);
}
