// The catalogue of the vendor's package server and the added feeds, and
// installing from it: icons, recommendations first, beta and upgrade marks;
// an install through the wizard with its progress; a slow download followed
// across a reload and in a second tab, then cancelled; a withdrawn file that
// fails in words; a package from the community feed.

import { test } from 'node:test';
import assert from 'node:assert/strict';
import { execFileSync } from 'node:child_process';
import { readdirSync, readFileSync } from 'node:fs';
import { createServer, type Server } from 'node:http';
import type { AddressInfo } from 'node:net';
import type { Locator, Page } from 'playwright-core';
import { kPassword } from './appliance.ts';
import { checkAccessibility, openPage, screenshot } from './browser.ts';
import { card, shown } from './screens.ts';
import { pagesPerTest, useSuite, type Opened } from './suite.ts';

// The slow package: large enough, and sent slowly enough (64 KiB a second),
// that a download is still under way while the test reloads and looks from a
// second tab. Nothing in it is ever installed: the test cancels it.
const kSlowSize = 8 * 1024 * 1024;
const kSlowChunk = 16 * 1024;

function startSlowServer(): Promise<Server> {
  const server = createServer((request, response) => {
    const base = `http://127.0.0.1:${(server.address() as AddressInfo).port}`;
    if (request.url?.startsWith('/catalogue.json')) {
      const entry = { package: 'demo-slow', version: '1.0', dname: 'Demo Slow', desc: 'A large package sent slowly.', link: `${base}/demo-slow.kpk`, size: kSlowSize };
      response.writeHead(200, { 'Content-Type': 'application/json' });
      response.end(JSON.stringify([entry]));
      return;
    }
    if (request.url === '/demo-slow.kpk') {
      response.writeHead(200, { 'Content-Type': 'application/octet-stream', 'Content-Length': kSlowSize });
      let sent = 0;
      const timer = setInterval(() => {
        response.write(Buffer.alloc(kSlowChunk, sent & 0xff));
        sent += kSlowChunk;
        if (sent >= kSlowSize) {
          clearInterval(timer);
          response.end();
        }
      }, 250);
      response.on('close', () => clearInterval(timer));
      return;
    }
    response.writeHead(404).end();
  });
  return new Promise((done) => server.listen(0, '127.0.0.1', () => done(server)));
}

let slowServer: Server | undefined;

const suite = useSuite({
  prepare: async (appliance) => {
    appliance.agreeToTerms();
    slowServer = await startSlowServer();
    await addFeed(`http://127.0.0.1:${(slowServer.address() as AddressInfo).port}/catalogue.json`, 'slow');
  },
  cleanUp: () => {
    slowServer?.closeAllConnections();
    slowServer?.close();
  },
});
const pages = pagesPerTest(suite);

// The web API as a script calls it (with the session id), for what the test
// arranges outside the page.
async function callApi(params: Record<string, string>): Promise<{ success: boolean; data?: unknown; error?: { code: number } }> {
  const endpoint = new URL('webapi/entry.cgi', suite.appliance.url);
  const login = await fetch(endpoint, { method: 'POST', body: new URLSearchParams({ api: 'KIVO.API.Auth', version: '1', method: 'login', account: 'admin', passwd: kPassword }) });
  const { data } = (await login.json()) as { data: { sid: string } };
  const answer = await fetch(endpoint, { method: 'POST', body: new URLSearchParams({ ...params, _sid: data.sid }) });
  return (await answer.json()) as { success: boolean; data?: unknown; error?: { code: number } };
}

async function addFeed(feed: string, name: string): Promise<void> {
  const answer = await callApi({ api: 'KIVO.Core.Package.Feed', version: '1', method: 'add', list: JSON.stringify(JSON.stringify({ feed, name })) });
  assert.equal(answer.success, true, JSON.stringify(answer));
}

// Opens the catalogue, agreeing to the terms of service when the package
// center asks first (the account's first visit).
async function openCatalogue(page: Page): Promise<void> {
  await page.goto(new URL('#/catalogue', suite.appliance.url).href);
  const agree = page.getByRole('button', { name: 'I agree' });
  const listed = page.getByRole('heading', { name: 'Recommended' });
  await agree
    .or(listed)
    .first()
    .waitFor()
    .catch(async (e: unknown) => {
      throw new Error(`neither the terms nor the catalogue show; ${await shown(page.locator('body'))}`, { cause: e });
    });
  if (await agree.isVisible()) await agree.click();
  await listed.waitFor();
}

// A browser context of the test's own, signed in and showing the catalogue.
async function signedInCatalogue(): Promise<Opened> {
  const opened = await pages.signedIn();
  await openCatalogue(opened.page);
  return opened;
}

// The download bar's value, waiting until the bar shows a number.
async function downloadPercent(scope: Locator): Promise<number> {
  const bar = scope.getByRole('progressbar');
  await bar.waitFor();
  for (;;) {
    const value = await bar.getAttribute('value');
    if (value !== null && Number(value) > 0) return Number(value);
    await scope.page().waitForTimeout(100);
  }
}

function downloadFolders(): string[] {
  return readdirSync(suite.appliance.file('/volume1/@tmp')).filter((name) => name.startsWith('download-'));
}

test('on the stable channel beta versions are not offered; on the beta channel they are, marked', async () => {
  const { page } = await signedInCatalogue();
  const recommended = page.getByRole('list').first();
  assert.deepEqual(await recommended.getByRole('heading').allTextContents(), ['Demo Web']);
  await page.getByText('One beta version is not offered: the update channel is “Stable versions only”.').waitFor();
  assert.equal(await card(page, 'Demo Beta').count(), 0);
  await screenshot(page, 'catalogue-stable-channel');

  suite.appliance.setUpdateChannel('beta');
  try {
    await page.getByRole('button', { name: 'Refresh' }).click();
    await card(page, 'Demo Beta').getByText('Beta', { exact: true }).waitFor();
    assert.deepEqual(await recommended.getByRole('heading').allTextContents(), ['Demo Web', 'Demo Beta']);
    assert.equal(await page.getByText('not offered: the update channel').count(), 0);
  } finally {
    suite.appliance.setUpdateChannel('stable');
  }
});

test('the catalogue shows icons, recommendations first in the server order, the beta mark, the upgrade and the feed', async () => {
  suite.appliance.setUpdateChannel('beta');
  const { page } = await signedInCatalogue();

  const recommended = page.getByRole('list').first();
  assert.deepEqual(await recommended.getByRole('heading').allTextContents(), ['Demo Web', 'Demo Beta']);
  await card(page, 'Demo Beta').getByText('Beta', { exact: true }).waitFor();
  await card(page, 'Demo Web').getByText('Upgrade available').waitFor();
  await card(page, 'Demo Web').getByRole('button', { name: 'Upgrade Demo Web' }).waitFor();
  await card(page, 'Demo Wizard').getByRole('button', { name: 'Install Demo Wizard' }).waitFor();
  await card(page, 'Demo Slow').getByText('From the feed slow').waitFor();
  await page.getByRole('status').filter({ hasText: 'One installed package has an upgrade.' }).waitFor();

  // Every icon arrived as a picture.
  const icons = page.locator('img.catalogue-icon');
  await page.waitForFunction(() => Array.from(document.querySelectorAll('img.catalogue-icon')).every((i) => (i as HTMLImageElement).complete));
  const widths = await icons.evaluateAll((imgs) => imgs.map((i) => (i as HTMLImageElement).naturalWidth));
  assert.ok(widths.length >= 7 && widths.every((w) => w > 0), `icon widths ${widths}`);

  await screenshot(page, 'catalogue');
  await checkAccessibility(page, 'catalogue');

  // The search box narrows the list; a miss says so.
  await page.getByLabel('Search packages').fill('notes');
  await card(page, 'Demo Notes').waitFor();
  assert.equal(await page.getByRole('listitem').count(), 1);
  await page.getByLabel('Search packages').fill('no such thing');
  await page.getByText('No package matches').waitFor();
  suite.appliance.setUpdateChannel('stable');
});

test('demo-wizard installs from the server through its wizard, with progress, and its answer arrives', async () => {
  const { page } = await signedInCatalogue();

  await card(page, 'Demo Wizard').getByRole('button', { name: 'Install Demo Wizard' }).click();
  const dialog = page.getByRole('dialog', { name: 'Install Demo Wizard' });
  await dialog.getByLabel('Greeting').fill('Good morning');
  await screenshot(page, 'catalogue-install-wizard');
  await checkAccessibility(page, 'catalogue install wizard');
  await dialog.getByRole('button', { name: 'Next' }).click();
  await dialog.getByRole('radio', { name: /\/volume1/ }).check();
  await dialog.getByRole('button', { name: 'Next' }).click();
  await dialog.getByText('Summary').waitFor();
  await dialog.getByRole('button', { name: 'Install', exact: true }).click();
  await dialog.waitFor({ state: 'detached' });

  await card(page, 'Demo Wizard').getByText('Demo Wizard is installed.').waitFor({ timeout: 30_000 });
  await card(page, 'Demo Wizard').getByText(/^Installed/).waitFor();
  assert.match(suite.appliance.kivoctl('list'), /demo-wizard\s+1\.0/);
  const greeting = execFileSync('find', [suite.appliance.root, '-name', 'greeting.txt'], { encoding: 'utf8' }).trim().split('\n')[0];
  assert.equal(readFileSync(greeting, 'utf8').trim(), 'Good morning');
  assert.deepEqual(downloadFolders(), []);
});

test('a download goes on across a reload and shows in a second tab; cancelling it ends it everywhere', async () => {
  const { context, page } = await signedInCatalogue();

  await card(page, 'Demo Slow').getByRole('button', { name: 'Install Demo Slow' }).click();
  const before = await downloadPercent(card(page, 'Demo Slow'));
  await screenshot(page, 'catalogue-progress');

  await page.reload();
  await page.getByRole('heading', { name: 'Recommended' }).waitFor();
  const bar = card(page, 'Demo Slow').getByRole('progressbar');
  await page.waitForFunction(
    ([label, seen]) => {
      const value = document.querySelector(`progress[aria-label^="${label}"]`)?.getAttribute('value');
      return value !== null && value !== undefined && Number(value) > seen;
    },
    ['Downloading Demo Slow', before] as const,
  );
  assert.match((await bar.getAttribute('aria-label')) ?? '', /^Downloading Demo Slow \(.* of 8\.4 MB\)$/);

  const second = await openPage(context, new URL('#/catalogue', suite.appliance.url).href, suite.watch);
  assert.ok((await downloadPercent(card(second, 'Demo Slow'))) > 0);
  assert.equal(downloadFolders().length, 1);

  await card(second, 'Demo Slow').getByRole('button', { name: 'Cancel' }).click();
  await card(second, 'Demo Slow').getByText('The download of Demo Slow was cancelled.').waitFor({ timeout: 20_000 });
  // The first tab learns that the task is gone and offers the install again.
  await card(page, 'Demo Slow').getByRole('button', { name: 'Install Demo Slow' }).waitFor();
  assert.deepEqual(downloadFolders(), []);
  const status = await callApi({ api: 'KIVO.Core.Package.Installation', version: '1', method: 'status', task_id: '@KIVOPKG_DOWNLOAD_demo-slow' });
  assert.deepEqual(status.data, { finished: true });
});

test('status answers lost on the way do not stop a card following its download', async () => {
  const { page } = await signedInCatalogue();
  // The next three status questions of the download get no answer at all,
  // as from a busy appliance or a network blip.
  let dropped = 0;
  await page.route('**/webapi/entry.cgi', async (route) => {
    const asked = new URLSearchParams(route.request().postData() ?? '');
    if (dropped < 3 && asked.get('api') === 'KIVO.Core.Package.Installation' && asked.get('method') === 'status') {
      dropped += 1;
      await route.abort('connectionreset');
      return;
    }
    await route.continue();
  });

  const slow = card(page, 'Demo Slow');
  await slow.getByRole('button', { name: 'Install Demo Slow' }).click();
  for (const deadline = Date.now() + 20_000; dropped < 3; await page.waitForTimeout(100)) {
    assert.ok(Date.now() < deadline, `only ${dropped} status questions were asked; ${await shown(slow)}`);
  }
  // The card asks again and follows the download on.
  const seen = await downloadPercent(slow);
  await page.waitForFunction(
    ([label, before]) => {
      const value = document.querySelector(`progress[aria-label^="${label}"]`)?.getAttribute('value');
      return value !== null && value !== undefined && Number(value) > before;
    },
    ['Downloading Demo Slow', seen] as const,
  );
  assert.equal(dropped, 3);
  assert.equal(await slow.getByRole('button', { name: 'Check again' }).count(), 0, await shown(slow));

  await slow.getByRole('button', { name: 'Cancel' }).click();
  await slow.getByText('The download of Demo Slow was cancelled.').waitFor({ timeout: 20_000 });
});

test('a download failure that another reader took first still shows in the card', async () => {
  const { page } = await signedInCatalogue();
  // The appliance drops a failed download's task on the first status read
  // that sees the failure. Here that read is taken on the page's behalf and
  // its answer kept from it: the page only hears the next one, that the task
  // is gone, as a second tab would.
  let takenFirst = false;
  await page.route('**/webapi/entry.cgi', async (route) => {
    const asked = new URLSearchParams(route.request().postData() ?? '');
    if (takenFirst || asked.get('method') !== 'status' || asked.get('api') !== 'KIVO.Core.Package.Installation') {
      await route.continue();
      return;
    }
    let answer = await route.fetch();
    const body = (await answer.json()) as { data?: { finished?: boolean; error?: unknown } };
    if (body.data?.finished && body.data.error !== undefined) {
      takenFirst = true;
      answer = await route.fetch();
    }
    await route.fulfill({ response: answer });
  });

  const gone = card(page, 'Demo Gone');
  await gone.getByRole('button', { name: 'Install Demo Gone' }).click();
  await gone.getByRole('alert').filter({ hasText: 'the server answered HTTP 404' }).waitFor();
  assert.ok(takenFirst, 'the failure reached the page without being read first elsewhere');
  await gone.getByRole('button', { name: 'Install Demo Gone' }).waitFor();
});

test('a withdrawn package file fails with the server message, and a community package installs from its feed', async () => {
  const { page } = await signedInCatalogue();

  await card(page, 'Demo Gone').getByRole('button', { name: 'Install Demo Gone' }).click();
  await card(page, 'Demo Gone').getByRole('alert').filter({ hasText: 'the server answered HTTP 404' }).waitFor();
  await card(page, 'Demo Gone').getByRole('button', { name: 'Install Demo Gone' }).waitFor();
  assert.deepEqual(downloadFolders(), []);

  await addFeed(new URL('community/catalogue.json', suite.appliance.url).href, 'community');
  await page.getByRole('button', { name: 'Refresh' }).click();
  const unsigned = card(page, 'Demo Unsigned');
  await unsigned.getByText('From the feed community').waitFor();
  await unsigned.getByRole('button', { name: 'Install Demo Unsigned' }).click();
  const dialog = page.getByRole('dialog', { name: 'Install Demo Unsigned' });
  await dialog.getByText('Install on volume').waitFor();
  await dialog.getByRole('button', { name: 'Next' }).click();
  await dialog.getByRole('button', { name: 'Install', exact: true }).click();
  await unsigned.getByText('Demo Unsigned is installed.').waitFor({ timeout: 30_000 });
  assert.match(suite.appliance.kivoctl('list'), /demo-unsigned\s/);
});
