// The addresses of the pictures the browser loads by URL (docs/images.md):
// those methods need the session cookie only, not the token.

import type { Api } from './client';
import type { ServerEntry } from './server';

// An installed package's icon; the appliance sends the package center's own
// icon when the package has none.
export function iconUrl(api: Api, id: string, version: string, size: 72 | 256): string {
  return api.url('KIVO.Core.Package.Thumb', 'get', 1, { name: id, ver: version, size });
}

// The icon of a catalogue entry, from its server through the appliance.
export function entryIconUrl(api: Api, entry: ServerEntry): string {
  return api.url('KIVO.Core.Package.Thumb.Server', 'get', 1, { name: entry.id, ver: entry.version ?? '', size: 72, link: entry.icon ?? '' });
}

// Screenshot `index` (from 1) of an installed package.
export function screenshotUrl(api: Api, id: string, version: string, index: number): string {
  return api.url('KIVO.Core.Package.Screenshot', 'get', 1, { name: id, ver: version, index });
}
