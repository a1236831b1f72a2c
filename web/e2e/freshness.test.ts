// How fresh the catalogue is, and release notes before an upgrade: each
// added feed under its own heading with when it was last fetched; a feed
// whose server starts failing is shown failing, with why, since when and its
// last good fetch, after Refresh asks every server again; a feed that
// answers but lists nothing says so, when added and in the catalogue. The
// upgrade dialog shows the new version's release notes from the catalogue,
// and a manual upgrade shows those of the uploaded file, as text.

import { test } from 'node:test';
import assert from 'node:assert/strict';
import { createServer, type Server } from 'node:http';
import type { AddressInfo } from 'node:net';
import { checkAccessibility, screenshot } from './browser.ts';
import { buildSample, callApi, installedState, offerInVendorCatalogue } from './published.ts';
import { card, openCatalogue } from './screens.ts';
import { pagesPerTest, useSuite } from './suite.ts';

// A feed of its own: its catalogue lists one package (a file it never
// serves: nothing is installed from it), until `failing` makes it answer
// 503. The switch is this process's own state, read whole by each request.
let failing = false;
function startFeedServer(): Promise<Server> {
  const server = createServer((request, response) => {
    if (request.url?.startsWith('/good.json')) {
      if (failing) return void response.writeHead(503).end('down for maintenance');
      const base = `http://127.0.0.1:${(server.address() as AddressInfo).port}`;
      const entry = { package: 'demo-fresh', version: '1.0', dname: 'Demo Fresh', desc: 'A package of a feed that later fails.', link: `${base}/demo-fresh.kpk` };
      response.writeHead(200, { 'Content-Type': 'application/json' });
      return void response.end(JSON.stringify({ packages: [entry] }));
    }
    if (request.url?.startsWith('/empty.json')) {
      response.writeHead(200, { 'Content-Type': 'application/json' });
      return void response.end(JSON.stringify({ packages: [] }));
    }
    response.writeHead(404).end();
  });
  return new Promise((done) => server.listen(0, '127.0.0.1', () => done(server)));
}

let feedServer: Server | undefined;
const feedUrl = (path: string) => `http://127.0.0.1:${(feedServer?.address() as AddressInfo).port}${path}`;

const suite = useSuite({
  prepare: async (appliance) => {
    appliance.agreeToTerms();
    feedServer = await startFeedServer();
    const added = await callApi(appliance, { api: 'KIVO.Core.Package.Feed', version: '1', method: 'add', list: JSON.stringify(JSON.stringify({ feed: feedUrl('/good.json'), name: 'Good feed' })) });
    assert.equal(added.success, true, JSON.stringify(added));
  },
  cleanUp: () => {
    feedServer?.closeAllConnections();
    feedServer?.close();
  },
});
const pages = pagesPerTest(suite);

test('a feed that starts failing is shown failing, with why, since when and its last good fetch', async () => {
  failing = false;
  const { page } = await pages.signedIn();
  await openCatalogue(page, suite.appliance);
  const good = page.getByRole('region', { name: 'From the feed Good feed' });
  await good.getByText(/^Fetched (just now|\d+ minutes? ago) \(.+\)\. It lists one package\.$/).waitFor();
  await card(page, 'Demo Fresh').waitFor();
  await page.getByRole('region', { name: "From the feed Good feed" }).getByRole('listitem', { name: 'Demo Fresh' }).waitFor();

  failing = true;
  await page.getByRole('button', { name: 'Refresh' }).click();
  const alert = good.getByRole('alert');
  await alert.getByText('The feed Good feed is failing').waitFor();
  const words = (await alert.innerText()).replace(/\s+/g, ' ');
  assert.match(words, /is failing since .+ \((just now|\d+ minutes? ago)\): the server answered HTTP 503\./);
  assert.match(words, /last fetched successfully (just now|\d+ minutes? ago)/);
  assert.match(words, /Its packages cannot be shown until it answers again/);
  // Its package is gone with its catalogue; the vendor's are still there.
  assert.equal(await card(page, 'Demo Fresh').count(), 0);
  await card(page, 'Demo Web').waitFor();
  await screenshot(page, 'catalogue-failing-feed');
  await checkAccessibility(page, 'catalogue with a failing feed');

  // It answers again: Refresh asks it again, and it is fine.
  failing = false;
  await page.getByRole('button', { name: 'Refresh' }).click();
  await good.getByText(/^Fetched just now/).waitFor();
  await card(page, 'Demo Fresh').waitFor();
  assert.equal(await good.getByRole('alert').count(), 0);
});

test('a feed that answers but lists nothing says so when added and in the catalogue', async () => {
  const { page } = await pages.signedIn();
  await page.goto(new URL('#/settings', suite.appliance.url).href);
  await page.getByLabel('Name', { exact: true }).fill('Empty feed');
  await page.getByLabel('Address', { exact: true }).fill(feedUrl('/empty.json'));
  await page.getByRole('button', { name: 'Add feed' }).click();
  await page.getByText('It answers, but its catalogue lists no packages').waitFor({ timeout: 20_000 });
  await openCatalogue(page, suite.appliance);
  await page.getByRole('region', { name: 'From the feed Empty feed' }).getByText('The feed Empty feed answers, but its catalogue lists no packages').waitFor();
  const removed = await callApi(suite.appliance, { api: 'KIVO.Core.Package.Feed', version: '1', method: 'delete', list: JSON.stringify(JSON.stringify([feedUrl('/empty.json')])) });
  assert.equal(removed.success, true, JSON.stringify(removed));
});

const kNotes = '2.0 brings:\n- a changelog page\n- <b>tags</b> are shown as typed\n';

test('the upgrade dialog shows the release notes the catalogue carries, as text', async () => {
  const from = installedState(suite.appliance, 'demo-web').version;
  const to = `${Number(from.split('.')[0]) + 1}.0.0-0001`;
  const kpk = buildSample(suite.appliance, 'demo-web-update', { package: 'demo-web', version: to }, { CHANGELOG: kNotes });
  await offerInVendorCatalogue(suite.appliance, kpk, `demo-web-${to}.kpk`);
  const { page } = await pages.signedIn();
  await openCatalogue(page, suite.appliance);
  await card(page, 'Demo Web').getByRole('button', { name: 'Upgrade Demo Web' }).click();
  const dialog = page.getByRole('dialog', { name: `Upgrade Demo Web from ${from} to ${to}` });
  const notes = dialog.getByRole('region', { name: `What's new in ${to}` });
  await notes.getByText('<b>tags</b> are shown as typed').waitFor();
  assert.equal(await notes.locator('b').count(), 0, 'no markup is made of the notes');
  assert.equal(await notes.getByLabel(`Release notes of ${to}`).innerText(), kNotes.trim());
  await screenshot(page, 'upgrade-release-notes');
  await checkAccessibility(page, 'upgrade dialog with release notes');
});

test('a manual upgrade shows the release notes of the uploaded file first', async () => {
  const from = installedState(suite.appliance, 'demo-web').version;
  const to = `${Number(from.split('.')[0]) + 5}.0.0-0001`;
  const kpk = buildSample(suite.appliance, 'demo-web-update', { package: 'demo-web', version: to }, { CHANGELOG: kNotes });
  const { page } = await pages.signedIn();
  await page.getByRole('link', { name: 'Manual install' }).click();
  await page.getByRole('heading', { name: 'Manual install' }).waitFor();
  await page.getByLabel('Package file').setInputFiles(kpk);
  await page.getByRole('button', { name: 'Upload' }).click();
  const dialog = page.getByRole('dialog');
  await dialog.getByText(/Step 1 of \d+: Release notes/).waitFor({ timeout: 30_000 });
  await dialog.getByRole('region', { name: `What's new in ${to}` }).getByText('<b>tags</b> are shown as typed').waitFor();
  await screenshot(page, 'manual-upgrade-release-notes');
  await dialog.getByRole('button', { name: 'Cancel' }).click();
  await dialog.waitFor({ state: 'detached' });
  assert.equal(installedState(suite.appliance, 'demo-web').version, from);
});
