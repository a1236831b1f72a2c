// What the watchdog did, on the page: demo-web's service dies as it starts
// while another program holds its port, the real watchdog (`kivoctl
// watchdog`) restarts it and gives up, and the installed list and the
// package's page say "crashed: stopped trying after N restarts" with the
// reason and the log's last lines; "Start again", once the port is free,
// runs it again and the mark goes.

import { test } from 'node:test';
import assert from 'node:assert/strict';
import { spawn, type ChildProcess } from 'node:child_process';
import { existsSync, readFileSync } from 'node:fs';
import { createServer, type Server } from 'node:net';
import { join } from 'node:path';
import { kBuild, type Appliance } from './appliance.ts';
import { checkAccessibility, screenshot } from './browser.ts';
import { waitUntil } from './published.ts';
import { row } from './screens.ts';
import { pagesPerTest, useSuite } from './suite.ts';

let watchdog: ChildProcess | undefined;
let squatter: Server | undefined;

function holdPort(port: number): Promise<Server> {
  return new Promise((done, fail) => {
    const server = createServer();
    server.once('error', fail);
    server.listen(port, '0.0.0.0', () => done(server));
  });
}

// Takes demo-web's port and lets the real watchdog give up on it.
async function crashDemoWeb(appliance: Appliance): Promise<void> {
  appliance.agreeToTerms();
  // Quick checks and a short patience, so that giving up takes seconds.
  appliance.replace('/etc/kivo/watchdog.conf', 'interval_seconds="1"\nmax_restarts="2"\nrestart_delay_seconds="1"\n');
  const pid = Number(readFileSync(appliance.file('/var/packages/demo-web/var/daemon.pid'), 'utf8'));
  process.kill(pid, 'SIGKILL');
  // The port is taken as soon as demo-web lets go of it.
  await waitUntil('demo-web lets go of its port', async () => {
    try {
      squatter = await holdPort(appliance.demoWebPort);
      return true;
    } catch {
      return false;
    }
  });
  watchdog = spawn(join(kBuild, 'bin/kivoctl'), ['--root', appliance.root, 'watchdog'], { stdio: 'ignore' });
  await waitUntil('the watchdog gives up on demo-web', () => existsSync(appliance.file('/var/packages/demo-web/crashed')), 60);
}

// The watchdog ends before the appliance stops its packages.
async function endWatchdog(): Promise<void> {
  const running = watchdog;
  if (running && running.exitCode === null) {
    const ended = new Promise((r) => running.once('exit', r));
    running.kill('SIGTERM');
    await ended;
  }
  await new Promise((r) => (squatter ? squatter.close(r) : r(undefined)));
}

const suite = useSuite({ prepare: crashDemoWeb, cleanUp: endWatchdog });
const pages = pagesPerTest(suite);

test('a package the watchdog gave up on says so, why, and starts again', async () => {
  const { page } = await pages.signedIn();
  await page.getByRole('heading', { name: 'Installed packages' }).waitFor();
  const note = row(page, 'Demo Web').getByRole('group', { name: 'Demo Web crashed' });
  await note.getByText('Crashed: stopped trying after 2 restarts').waitFor();
  await note.getByText('it stopped running again after each of 2 restarts within an hour').waitFor();
  await screenshot(page, 'watchdog-crashed-list');
  await checkAccessibility(page, 'watchdog crashed list');

  await page.getByRole('link', { name: 'Demo Web', exact: true }).click();
  await page.getByRole('heading', { name: 'Demo Web' }).waitFor();
  const details = page.getByRole('group', { name: 'Demo Web crashed' });
  await details.getByText('The last lines of its log').click();
  // php says why it could not serve.
  await details.locator('pre.log').getByText(/Address already in use|Failed to listen/).waitFor();
  await screenshot(page, 'watchdog-crashed-details');
  await checkAccessibility(page, 'watchdog crashed details');

  await new Promise((r) => squatter?.close(r));
  squatter = undefined;
  await details.getByRole('button', { name: 'Start again' }).click();
  await page.getByRole('group', { name: 'Demo Web crashed' }).waitFor({ state: 'detached' });
  assert.match(suite.appliance.kivoctl('status', 'demo-web'), /running/);
  assert.equal(existsSync(suite.appliance.file('/var/packages/demo-web/crashed')), false);
});
