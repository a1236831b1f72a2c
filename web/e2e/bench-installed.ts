// Benchmark, not a test: how fast the installed-packages screen is with 300
// packages. Makes a system root, builds and installs 300 generated packages
// with kivoctl, serves it with lighttpd and the built page (build/page, from
// scripts/build-page.sh, or the folder in KIVO_PAGE_DIR), and prints:
//   - the list call's time as the page sees it,
//   - the time from loading the page (signed in) to the first rows on
//     screen, and to all rows in the document,
//   - a scroll through the whole list: its duration and the longest frame.
//
//   cd web && node --import tsx e2e/bench-installed.ts [COUNT]

import { execFile, execFileSync, spawn } from 'node:child_process';
import { cpSync, mkdirSync, mkdtempSync, readFileSync, renameSync, rmSync, writeFileSync } from 'node:fs';
import { tmpdir } from 'node:os';
import { join } from 'node:path';
import { promisify } from 'node:util';
import { createHash } from 'node:crypto';
import { freePort, kBuild } from './appliance.ts';
import type { Response } from 'playwright-core';
import { launch, signIn } from './browser.ts';

const kCount = Number(process.argv[2] ?? 300);
const kKivoctl = join(kBuild, 'bin/kivoctl');
const run = promisify(execFile);

// A package source with nothing to run: the screen's cost does not depend
// on what a package does.
function writeSource(folder: string, n: number): string {
  const id = `bench-${String(n).padStart(4, '0')}`;
  const source = join(folder, id);
  mkdirSync(join(source, 'package'), { recursive: true });
  writeFileSync(join(source, 'package/README'), `${id}\n`);
  const info = { package: id, version: `1.0.${n}`, displayname: `Bench package ${n}`, description: `Generated package ${n}.`, startable: 'no' };
  writeFileSync(join(source, 'INFO'), Object.entries(info).map(([k, v]) => `${k}="${v}"\n`).join(''));
  return source;
}

async function installAll(root: string, work: string): Promise<void> {
  // Two at a time: builds overlap, installs take the package tool's lock anyway.
  const next = { n: 1 };
  const worker = async () => {
    while (next.n <= kCount) {
      const n = next.n++;
      const file = join(work, `${n}.kpk`);
      await run(kKivoctl, ['build', writeSource(work, n), file]);
      await run(kKivoctl, ['--root', root, 'install', file]);
    }
  };
  await Promise.all([worker(), worker()]);
}

async function main(): Promise<void> {
  const root = mkdtempSync(join(tmpdir(), 'kivo-bench-installed-'));
  const work = join(root, 'sources');
  const port = await freePort();
  execFileSync(kKivoctl, ['init-root', root], { stdio: 'ignore' });
  execFileSync(kKivoctl, ['--root', root, 'user-add', 'admin', '--password', 'admin', '--group', 'administrators'], { stdio: 'ignore' });
  // The packages are unsigned: this appliance accepts them (the trust level
  // binds, whatever an install asks).
  const info = join(root, 'etc/kivoinfo.conf');
  writeFileSync(`${info}.new`, readFileSync(info, 'utf8').replace(/^pkg_source_trust_level=.*$/m, 'pkg_source_trust_level="1"'));
  renameSync(`${info}.new`, info);
  writeFileSync(join(root, 'lighttpd.conf'), execFileSync(kKivoctl, ['--root', root, 'web-config', '--port', String(port)]));
  // The terms of service that the page asks the user to agree to first.
  const feed = join(root, 'usr/kivo/www/feed');
  mkdirSync(feed, { recursive: true });
  writeFileSync(join(feed, 'terms-of-service.txt'), 'Benchmark terms.\n');
  writeFileSync(join(feed, 'company-info.json'), JSON.stringify({ content_hash: createHash('sha256').update('Benchmark terms.\n').digest('hex') }));
  execFileSync(kKivoctl, ['--root', root, 'server-config', '--company-info', `http://127.0.0.1:${port}/feed/company-info.json`], { stdio: 'ignore' });
  cpSync(process.env.KIVO_PAGE_DIR ?? join(kBuild, 'page'), join(root, 'usr/kivo/www'), { recursive: true });
  const started = performance.now();
  await installAll(root, work);
  console.log(`set-up: ${kCount} packages built and installed in ${((performance.now() - started) / 1000).toFixed(1)} s`);

  const server = spawn('/usr/sbin/lighttpd', ['-D', '-f', join(root, 'lighttpd.conf')], { stdio: 'ignore' });
  const browser = await launch();
  try {
    const url = `http://127.0.0.1:${port}/`;
    for (let i = 0; i < 100; ++i) {
      try {
        if ((await fetch(url)).ok) break;
      } catch {
        await new Promise((r) => setTimeout(r, 50));
      }
    }
    const page = await browser.newPage({ viewport: { width: 1280, height: 800 } });
    // Marks, in the page's own clock, the moment the last row is in the
    // document. Injected by the browser's debugging protocol, which the
    // page's CSP does not govern.
    await page.addInitScript((count: number) => {
      const marks = window as unknown as { firstAt?: number; rowsAt?: number };
      new MutationObserver((_, observer) => {
        const rows = document.getElementsByClassName('installed-row').length;
        if (rows > 0 && marks.firstAt === undefined) marks.firstAt = performance.timeOrigin + performance.now();
        if (rows < count) return;
        marks.rowsAt = performance.timeOrigin + performance.now();
        observer.disconnect();
      }).observe(document, { childList: true, subtree: true });
    }, kCount);
    await page.goto(url);
    await signIn(page);
    await page.getByRole('button', { name: 'I agree' }).click();
    const rows = page.getByRole('list', { name: 'Installed packages' }).getByRole('listitem');
    const isList = (r: Response) => /api=KIVO\.Core\.Package&.*method=list/.test(r.request().postData() ?? '');
    for (let round = 1; round <= 3; ++round) {
      const listCall = page.waitForResponse(isList);
      await page.reload();
      const answered = await listCall;
      const size = (await answered.body()).length;
      await rows.nth(kCount - 1).waitFor({ state: 'attached' });
      const timing = answered.request().timing();
      const navigation = await page.evaluate(() => performance.timeOrigin);
      const { firstAt, rowsAt } = await page.evaluate(() => {
        const marks = window as unknown as { firstAt: number; rowsAt: number };
        return { firstAt: marks.firstAt, rowsAt: marks.rowsAt };
      });
      const answeredAt = timing.startTime + timing.responseEnd;
      console.log(
        `load ${round}: list call took ${(timing.responseEnd - timing.requestStart).toFixed(0)} ms (${(size / 1024).toFixed(0)} KiB), ` +
          `answered ${(answeredAt - navigation).toFixed(0)} ms after the page began to load; ` +
          `first rows on screen ${(firstAt - answeredAt).toFixed(0)} ms after the answer (${(firstAt - navigation).toFixed(0)} ms after the page began to load), ` +
          `all ${kCount} rows in the document ${(rowsAt - answeredAt).toFixed(0)} ms after the answer, ` +
          `${(rowsAt - navigation).toFixed(0)} ms after the page began to load`,
      );
    }
    // Scroll from top to bottom in steps of 400 pixels, one per frame, and
    // time every frame meanwhile.
    const scroll = await page.evaluate(async () => {
      window.scrollTo(0, 0);
      const frames: number[] = [];
      let last = performance.now();
      const begin = last;
      while (window.scrollY + window.innerHeight < document.documentElement.scrollHeight - 1) {
        window.scrollBy(0, 400);
        await new Promise((r) => requestAnimationFrame(r));
        const now = performance.now();
        frames.push(now - last);
        last = now;
      }
      frames.sort((a, b) => a - b);
      return { ms: last - begin, frames: frames.length, longest: frames[frames.length - 1], median: frames[frames.length >> 1] };
    });
    console.log(
      `scroll: ${scroll.frames} steps of 400 px in ${scroll.ms.toFixed(0)} ms, ` +
        `median frame ${scroll.median.toFixed(1)} ms, longest ${scroll.longest.toFixed(1)} ms`,
    );
  } finally {
    await browser.close();
    server.kill('SIGTERM');
    // The packages' control groups outlive the root's folder otherwise.
    try {
      execFileSync(kKivoctl, ['--root', root, 'drop-groups'], { stdio: 'ignore' });
    } catch {
      // without root or cgroups there were none to drop
    }
    rmSync(root, { recursive: true, force: true });
  }
}

await main();
