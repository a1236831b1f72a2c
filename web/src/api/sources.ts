// "KIVO.Core.Package.Sources" (docs/http-api.md): how fresh the catalogue
// is, per source: the vendor's package server and each added feed.

import type { Api, Result } from './client';

const kSources = 'KIVO.Core.Package.Sources';

export interface SourceStatus {
  kind: 'vendor' | 'feed';
  url: string;
  name: string;
  // ok: the latest fetch worked; failing: it failed (since failing_since,
  // because of error); unknown: no fetch on record; unconfigured: no vendor
  // server is set.
  state: 'ok' | 'failing' | 'unknown' | 'unconfigured';
  // Unix seconds, null when none is on record.
  last_attempt: number | null;
  last_success: number | null;
  failing_since: number | null;
  error: string;
  // The entries listed at the latest success; null when unknown.
  packages: number | null;
}

export interface SourcesAnswer {
  // The appliance's clock, in unix seconds: ages are told against it.
  now: number;
  sources: SourceStatus[];
}

// The record of the latest fetches; fetches nothing itself.
export function listSources(api: Api): Promise<Result<SourcesAnswer>> {
  return api.call<SourcesAnswer>(kSources, 'list', 1);
}
