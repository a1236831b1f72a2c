// A real appliance for the page's browser tests: a demo system root made by
// scripts/demo-root.sh (sample packages, the vendor's package server, the
// community feed, the built page) served by lighttpd and the web API on a
// free loopback port. Each test file gets its own, so files never see each
// other's installs.

import { execFileSync, spawn, type ChildProcess } from 'node:child_process';
import { existsSync, mkdirSync, mkdtempSync, readFileSync, renameSync, rmSync, writeFileSync } from 'node:fs';
import { createServer } from 'node:net';
import { tmpdir } from 'node:os';
import { dirname, join, resolve } from 'node:path';

export const kRepo = resolve(import.meta.dirname, '../..');
export const kPassword = 'admin';
// The build the appliances run: build/, or $BUILD_DIR as scripts/build.sh
// takes it (relative to the checkout).
export const kBuild = resolve(kRepo, process.env.BUILD_DIR ?? 'build');

// Whether packages can be confined here: root (to run them as their own
// users) and the kernel's memory and pids controllers (the unified
// hierarchy, or v1's). Landlock is judged by each package's record.
export const kConfinable =
  process.getuid?.() === 0 &&
  (existsSync('/sys/fs/cgroup/cgroup.controllers') || (existsSync('/sys/fs/cgroup/memory') && existsSync('/sys/fs/cgroup/pids')));

// Whether nothing listens on `port` now, on any address.
function unused(port: number): Promise<boolean> {
  return new Promise((done) => {
    const server = createServer();
    server.once('error', () => done(false));
    server.listen(port, '0.0.0.0', () => server.close(() => done(true)));
  });
}

// A port nothing listens on, chosen below the kernel's range of ephemeral
// ports: a port of that range can be taken, between its choice and its use,
// by any outgoing connection (the browser's, the web API's own fetches),
// and demo-web's install then refuses it as in use.
export async function freePort(): Promise<number> {
  const range = readFileSync('/proc/sys/net/ipv4/ip_local_port_range', 'utf8');
  const top = Math.min(Number(range.trim().split(/\s+/)[0]) || 32768, 65536) - 1;
  const bottom = Math.max(1024, top - 12_000);
  for (let attempt = 0; attempt < 100; ++attempt) {
    const port = bottom + Math.floor(Math.random() * (top - bottom + 1));
    if (await unused(port)) return port;
  }
  throw new Error(`no free port between ${bottom} and ${top}`);
}

async function waitForPage(url: string, server: ChildProcess): Promise<void> {
  for (let i = 0; i < 200; ++i) {
    if (server.exitCode !== null) throw new Error(`lighttpd ended with ${server.exitCode}`);
    try {
      if ((await fetch(url)).ok) return;
    } catch {
      // not listening yet
    }
    await new Promise((r) => setTimeout(r, 50));
  }
  throw new Error(`${url} did not answer`);
}

export class Appliance {
  private constructor(
    readonly root: string,
    readonly url: string,
    // The port demo-web serves its own page on in this appliance.
    readonly demoWebPort: number,
    private readonly server: ChildProcess,
  ) {}

  // An appliance that cannot start leaves nothing running behind: a web
  // server left running would keep the test file's process from ending.
  static async start(): Promise<Appliance> {
    const root = mkdtempSync(join(tmpdir(), 'kivo-page-'));
    const port = await freePort();
    // demo-web gets a port of its own too, so that appliances of other test
    // files, or a demo left running, never take it.
    const demoWebPort = await freePort();
    try {
      execFileSync(join(kRepo, 'scripts/demo-root.sh'), [root, String(port)], {
        env: { ...process.env, KIVO_DEMO_PASSWORD: kPassword, DEMO_WEB_PORT: String(demoWebPort) },
        stdio: ['ignore', 'ignore', 'inherit'],
      });
      expectDemoRunning(root, demoWebPort);
    } catch (e) {
      dropRoot(root);
      throw e;
    }
    const server = spawn('/usr/sbin/lighttpd', ['-D', '-f', join(root, 'lighttpd.conf')], {
      stdio: ['ignore', 'ignore', 'pipe'],
    });
    server.stderr?.on('data', (chunk: Buffer) => process.env.KIVO_E2E_VERBOSE && process.stderr.write(chunk));
    const url = `http://127.0.0.1:${port}/`;
    const appliance = new Appliance(root, url, demoWebPort, server);
    try {
      await waitForPage(url, server);
    } catch (e) {
      await appliance.stop();
      throw e;
    }
    return appliance;
  }

  // Runs kivoctl on this appliance's root, e.g. kivoctl('status', 'demo-web').
  kivoctl(...args: string[]): string {
    return kivoctlOn(this.root, ...args);
  }

  // Records that `account` agreed to the terms of service the demo's vendor
  // server publishes now, as the page stores it after "I agree": for tests
  // of other screens, which the terms would otherwise stand in front of.
  agreeToTerms(account = 'admin'): void {
    const info = JSON.parse(readFileSync(this.file('/usr/kivo/www/feed/company-info.json'), 'utf8')) as { content_hash: string };
    const agreed = { termofservice: true, termofservice_4_2: true, agreed_tos_hash: info.content_hash };
    this.replace(`/usr/kivo/etc/users/${account}/settings.json`, JSON.stringify({ 'KIVO.PXS.PkgManApp.Instance': agreed }));
  }

  // Sets the update channel as Settings stores it: on "stable" the catalogue
  // offers no beta version.
  setUpdateChannel(channel: 'stable' | 'beta'): void {
    const info = '/etc/kivoinfo.conf';
    const text = readFileSync(this.file(info), 'utf8');
    this.replace(info, text.replace(/^package_update_channel=.*$/m, `package_update_channel="${channel}"`));
  }

  // Replaces a file under the root the way the appliance writes the files
  // others read: a whole new file renamed over the old one. The web server
  // and the web API read these files while tests change them; a file
  // rewritten in place can be caught half written (lighttpd, told the old
  // size, then sends a truncated answer).
  replace(path: string, content: string): void {
    const target = this.file(path);
    mkdirSync(dirname(target), { recursive: true });
    const temporary = join(dirname(target), `.${Date.now()}-${process.pid}.tmp`);
    writeFileSync(temporary, content);
    renameSync(temporary, target);
  }

  // Runs `body` with `line` added to the root's etc/kivo/pkgtool.conf, then
  // puts the file back as it was (each change by replace()).
  async withToolSetting<T>(line: string, body: () => Promise<T>): Promise<T> {
    const conf = '/etc/kivo/pkgtool.conf';
    const before = existsSync(this.file(conf)) ? readFileSync(this.file(conf), 'utf8') : '';
    this.replace(conf, `${before}${line}\n`);
    try {
      return await body();
    } finally {
      this.replace(conf, before);
    }
  }

  // Replaces a file that this appliance's web server serves at `address`
  // (relative to its url) and waits until the server answers with the new
  // content: lighttpd may go on serving a replaced file from what it cached
  // of the old one for a moment, and a test that has the appliance fetch it
  // then would read the old text.
  async replaceServed(path: string, address: string, content: string): Promise<void> {
    this.replace(path, content);
    const url = new URL(address, this.url);
    for (let i = 0; i < 200; ++i) {
      if ((await (await fetch(url, { cache: 'no-store' })).text()) === content) return;
      await new Promise((r) => setTimeout(r, 50));
    }
    throw new Error(`${url} still serves its old content`);
  }

  // A path inside the root, e.g. file('/volume1/public/packages/demo-beta.kpk').
  file(path: string): string {
    return join(this.root, path);
  }

  async stop(): Promise<void> {
    if (this.server.exitCode === null) {
      const ended = new Promise((r) => this.server.once('exit', r));
      this.server.kill('SIGTERM');
      await ended;
    }
    dropRoot(this.root);
  }
}

function kivoctlOn(root: string, ...args: string[]): string {
  return execFileSync(join(kBuild, 'bin/kivoctl'), ['--root', root, ...args], { encoding: 'utf8' });
}

// demo-web and demo-notes (which needs it) run from the start: if another
// program took demo-web's port between its choice and the start, every
// test here would fail for no visible reason, so say so at once.
function expectDemoRunning(root: string, demoWebPort: number): void {
  const listed = kivoctlOn(root, 'list');
  for (const id of ['demo-web', 'demo-notes']) {
    if (!new RegExp(`^${id} .* running$`, 'm').test(listed)) {
      throw new Error(`${id} does not run in the test appliance; is something else holding port ${demoWebPort}?\n${listed}`);
    }
  }
}

// Stops what runs from `root` (the web server is stopped already) and
// removes it.
function dropRoot(root: string): void {
  // Package services the tests started run on after the web server.
  try {
    for (const id of kivoctlOn(root, 'list').split('\n').filter(Boolean)) kivoctlOn(root, 'stop', id.split(/\s/)[0]);
  } catch {
    // a package that will not stop is left to the root's removal
  }
  try {
    // The packages' control groups outlive the root's folder otherwise.
    kivoctlOn(root, 'drop-groups');
  } catch {
    // without root or cgroups there were none to drop
  }
  rmSync(root, { recursive: true, force: true });
}
