// Packages made at test time and what a test arranges around them: a
// sample's source with INFO values of the test's own, built and signed by
// the project's own scripts (examples/build.sh, with the appliance's demo
// publisher key, which the appliance trusts), offered in the vendor's
// catalogue the way `kivoctl index` lists it, and the web API called as a
// script calls it.

import { execFileSync } from 'node:child_process';
import { cpSync, mkdirSync, mkdtempSync, readdirSync, readFileSync, writeFileSync } from 'node:fs';
import { tmpdir } from 'node:os';
import { join } from 'node:path';
import { kBuild, kPassword, kRepo, type Appliance } from './appliance.ts';

// Builds examples/packages/`sample` with `info` laid over its INFO, as
// examples/build.sh builds the samples for this appliance (demo-web's port
// written in, the common service script added, signed with the appliance's
// demo key), and answers the package file's path. `files` (paths in the
// source, such as "scripts/health") are added, executable.
export function buildSample(appliance: Appliance, sample: string, info: Record<string, string>, files: Record<string, string> = {}): string {
  const work = mkdtempSync(join(tmpdir(), 'kivo-sample-'));
  const examples = join(work, 'examples');
  mkdirSync(join(examples, 'packages'), { recursive: true });
  cpSync(join(kRepo, 'examples/build.sh'), join(examples, 'build.sh'));
  cpSync(join(kRepo, 'examples/common'), join(examples, 'common'), { recursive: true });
  const id = info.package ?? sample;
  const source = join(examples, 'packages', id);
  cpSync(join(kRepo, 'examples/packages', sample), source, { recursive: true });
  writeFileSync(join(source, 'INFO'), withValues(readFileSync(join(source, 'INFO'), 'utf8'), info));
  for (const [path, content] of Object.entries(files)) {
    mkdirSync(join(source, path, '..'), { recursive: true });
    writeFileSync(join(source, path), content, { mode: 0o755 });
  }
  const out = join(work, 'out');
  mkdirSync(out);
  cpSync(appliance.file('/.samples/gnupg'), join(out, 'gnupg'), { recursive: true });
  execFileSync(join(examples, 'build.sh'), [join(kBuild, 'bin/kivoctl'), out], {
    env: { ...process.env, DEMO_WEB_PORT: String(appliance.demoWebPort) },
    stdio: ['ignore', 'ignore', 'inherit'],
  });
  return join(out, `${id}.kpk`);
}

// INFO text with `values` in place of its own (or added).
function withValues(text: string, values: Record<string, string>): string {
  const lines = text.split('\n').filter((l) => l.trim() !== '');
  for (const [key, value] of Object.entries(values)) {
    const line = `${key}="${value}"`;
    const at = lines.findIndex((l) => l.startsWith(`${key}=`));
    if (at >= 0) lines[at] = line;
    else lines.push(line);
  }
  return lines.join('\n') + '\n';
}

interface CatalogueEntry {
  package: string;
  version?: string;
}

// Offers the package file `kpk` in the vendor's catalogue in place of any
// entry of its package: indexed by `kivoctl index` on its own, its file and
// icons put beside the catalogue's, and the catalogue replaced as the web
// server serves it. The appliance is then made to ask its vendor again.
export async function offerInVendorCatalogue(appliance: Appliance, kpk: string, name: string): Promise<void> {
  const work = mkdtempSync(join(tmpdir(), 'kivo-offer-'));
  cpSync(kpk, join(work, name));
  const base = new URL('feed', appliance.url).href;
  appliance.kivoctl('index', work, '--base-url', base);
  const feed = '/usr/kivo/www/feed';
  cpSync(join(work, name), appliance.file(`${feed}/${name}`));
  for (const icon of readdirSync(join(work, 'icons'))) cpSync(join(work, 'icons', icon), appliance.file(`${feed}/icons/${icon}`));
  const offered = JSON.parse(readFileSync(join(work, 'catalogue.json'), 'utf8')) as { packages: CatalogueEntry[] };
  const served = JSON.parse(readFileSync(appliance.file(`${feed}/catalogue.json`), 'utf8')) as { packages: CatalogueEntry[] };
  const ids = new Set(offered.packages.map((p) => p.package));
  served.packages = [...served.packages.filter((p) => !ids.has(p.package)), ...offered.packages];
  await appliance.replaceServed(`${feed}/catalogue.json`, 'feed/catalogue.json', JSON.stringify(served, null, 2) + '\n');
  const listed = await callApi(appliance, { api: 'KIVO.Core.Package.Server', version: '1', method: 'list', blforcereload: 'true' });
  if (!listed.success) throw new Error(`the appliance did not read its vendor's catalogue again: ${JSON.stringify(listed)}`);
}

export interface Answer {
  success: boolean;
  data?: unknown;
  error?: { code: number; errors?: unknown };
}

// The web API as a script calls it (signed in with the session id), for
// what a test arranges or checks outside the page.
export async function callApi(appliance: Appliance, params: Record<string, string>): Promise<Answer> {
  const endpoint = new URL('webapi/entry.cgi', appliance.url);
  const login = await fetch(endpoint, {
    method: 'POST',
    body: new URLSearchParams({ api: 'KIVO.API.Auth', version: '1', method: 'login', account: 'admin', passwd: kPassword }),
  });
  const { data } = (await login.json()) as { data: { sid: string } };
  const answer = await fetch(endpoint, { method: 'POST', body: new URLSearchParams({ ...params, _sid: data.sid }) });
  return (await answer.json()) as Answer;
}

// The installed version of `id` ("" when it is not installed) and whether
// it runs, as kivoctl lists them.
export function installedState(appliance: Appliance, id: string): { version: string; running: boolean } {
  const line = appliance
    .kivoctl('list')
    .split('\n')
    .find((l) => l.startsWith(`${id} `));
  if (!line) return { version: '', running: false };
  const [, version, ...rest] = line.split(/\s+/);
  return { version, running: rest.includes('running') };
}

// Waits, checking every 100 ms for up to `seconds`, until `ready` holds.
export async function waitUntil(what: string, ready: () => boolean | Promise<boolean>, seconds = 30): Promise<void> {
  for (let i = 0; i < seconds * 10; ++i) {
    if (await ready()) return;
    await new Promise((r) => setTimeout(r, 100));
  }
  throw new Error(`gave up waiting: ${what}`);
}
