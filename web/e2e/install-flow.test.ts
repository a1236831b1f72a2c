// Installs that must not depend on the page: a reload right after the
// wizard's Install, again and again, always ends with the package installed
// and the card saying so; the wizard opens even when a catalogue refresh
// learns that the download is done before the download's own progress does;
// a card never offers Install beside the word that the package is
// installed. And what the installed list does for a package: open its web
// page while it runs, say when an uninstall is done; a manual install that
// starts the package when asked to.

import { test } from 'node:test';
import assert from 'node:assert/strict';
import type { Page, Route } from 'playwright-core';
import { screenshot } from './browser.ts';
import { callApi, installedState, waitUntil } from './published.ts';
import { card, openCatalogue, row } from './screens.ts';
import { pagesPerTest, useSuite } from './suite.ts';

// Demo Beta is the sample these installs use: the beta channel offers it.
const suite = useSuite({
  prepare: (appliance) => {
    appliance.agreeToTerms();
    appliance.setUpdateChannel('beta');
  },
});
const pages = pagesPerTest(suite);

function uninstall(id: string): void {
  if (installedState(suite.appliance, id).version !== '') suite.appliance.kivoctl('uninstall', id);
}

// The download task of `id` as the vendor's catalogue reports it.
async function reportedDownload(id: string): Promise<{ status?: string } | undefined> {
  const listed = await callApi(suite.appliance, { api: 'KIVO.Core.Package.Server', version: '1', method: 'list' });
  const entries = (listed.data as { data: { id: string; info?: { status?: string } }[] }).data;
  return entries.find((e) => e.id === id)?.info;
}

// What the page shows of Demo Beta now, for a failure's message.
async function shown(page: Page): Promise<string> {
  const texts = await page.locator('dialog[open], li').filter({ hasText: 'Demo Beta' }).allInnerTexts();
  return texts.map((t) => t.replace(/\s+/g, ' ')).join(' | ');
}

// Installs Demo Beta from the catalogue through its wizard and reloads the
// page right after the wizard's Install.
async function installAndReload(page: Page): Promise<void> {
  await card(page, 'Demo Beta').getByRole('button', { name: 'Install Demo Beta' }).click();
  const dialog = page.getByRole('dialog', { name: 'Install Demo Beta' });
  await dialog.getByRole('button', { name: 'Next' }).click();
  await dialog.getByRole('button', { name: 'Install', exact: true }).click();
  await page.reload();
  await page.getByRole('heading', { name: 'Recommended' }).waitFor();
}

test('a reload right after the wizard’s Install never loses the install (ten times)', async () => {
  const { page } = await pages.signedIn();
  for (let round = 1; round <= 10; ++round) {
    uninstall('demo-beta');
    await openCatalogue(page, suite.appliance);
    await page.reload();
    await page.getByRole('heading', { name: 'Recommended' }).waitFor();
    try {
      await installAndReload(page);
      await card(page, 'Demo Beta').getByText(/^Installed/).waitFor({ timeout: 60_000 });
    } catch (e) {
      const state = installedState(suite.appliance, 'demo-beta');
      assert.fail(`round ${round}: ${String(e).split('\n')[0]}; the page shows "${await shown(page)}"; demo-beta installed: ${JSON.stringify(state)}`);
    }
    assert.notEqual(installedState(suite.appliance, 'demo-beta').version, '', `round ${round}: demo-beta is not installed`);
  }
  uninstall('demo-beta');
});

test('the wizard opens when a catalogue refresh reports the download done before its progress does', async () => {
  uninstall('demo-wizard');
  const { page } = await pages.signedIn();
  await openCatalogue(page, suite.appliance);
  // The download's progress is held back (a slow network), so that the
  // refresh below is the first to learn that the download is done.
  const held: Route[] = [];
  let holding = true;
  await page.route('**/webapi/entry.cgi', (route) => {
    if (holding && /method=status\b/.test(route.request().postData() ?? '')) held.push(route);
    else void route.continue();
  });
  try {
    await card(page, 'Demo Wizard').getByRole('button', { name: 'Install Demo Wizard' }).click();
    await waitUntil('the download of demo-wizard is done', async () => (await reportedDownload('demo-wizard'))?.status === 'downloaded');
    await page.getByRole('button', { name: 'Refresh' }).click();
    await page.getByRole('button', { name: 'Refresh' }).waitFor();
    await page.getByRole('dialog', { name: 'Install Demo Wizard' }).getByLabel('Greeting').waitFor({ timeout: 10_000 });
  } finally {
    holding = false;
    for (const route of held.splice(0)) await route.continue().catch(() => {});
  }
  const dialog = page.getByRole('dialog', { name: 'Install Demo Wizard' });
  await dialog.getByRole('button', { name: 'Cancel' }).click();
  await card(page, 'Demo Wizard').getByRole('button', { name: 'Discard download' }).click();
  await card(page, 'Demo Wizard').getByText('The download was discarded.').waitFor();
});

test('a card never shows that a package is installed beside its Install button', async () => {
  uninstall('demo-beta');
  const { page } = await pages.signedIn();
  await openCatalogue(page, suite.appliance);
  // Every state the card passes through is looked at as it is drawn (a
  // script of its own: the test's compiled functions carry helpers the
  // page does not have).
  await page.evaluate(`
    window.bothShown = false;
    new MutationObserver(() => {
      const item = Array.from(document.querySelectorAll('li')).find((li) => li.querySelector('h3')?.textContent === 'Demo Beta');
      const install = item?.querySelector('button[aria-label="Install Demo Beta"]');
      if (install && (item?.textContent ?? '').includes('Demo Beta is installed.')) window.bothShown = true;
    }).observe(document.body, { subtree: true, childList: true, characterData: true });
  `);
  await card(page, 'Demo Beta').getByRole('button', { name: 'Install Demo Beta' }).click();
  const dialog = page.getByRole('dialog', { name: 'Install Demo Beta' });
  await dialog.getByRole('button', { name: 'Next' }).click();
  await dialog.getByRole('button', { name: 'Install', exact: true }).click();
  await card(page, 'Demo Beta').getByText('Demo Beta is installed.').waitFor({ timeout: 60_000 });
  await card(page, 'Demo Beta').getByText(/^Installed/).waitFor();
  assert.equal(await page.evaluate('window.bothShown'), false);
  uninstall('demo-beta');
});

test('the installed list opens a running package’s web page and says when an uninstall is done', async () => {
  suite.appliance.kivoctl('install', suite.appliance.file('/volume1/public/packages/demo-beta.kpk'), '--run');
  const { page } = await pages.signedIn();
  await page.getByRole('heading', { name: 'Installed packages' }).waitFor();

  const open = row(page, 'Demo Web').getByRole('link', { name: 'Open Demo Web' });
  assert.equal(await open.getAttribute('href'), `http://127.0.0.1:${suite.appliance.demoWebPort}/`);
  assert.equal(await row(page, 'Demo Notes').getByRole('link', { name: /^Open/ }).count(), 0, 'Demo Notes has no web page');
  await screenshot(page, 'installed-open');

  await row(page, 'Demo Beta').getByRole('button', { name: 'Uninstall Demo Beta' }).click();
  const dialog = page.getByRole('dialog', { name: 'Uninstall Demo Beta' });
  await dialog.getByRole('button', { name: 'Continue anyway' }).click();
  await dialog.getByRole('button', { name: 'Uninstall' }).click();
  await page.getByRole('status').filter({ hasText: 'Demo Beta was uninstalled.' }).waitFor();
  await row(page, 'Demo Beta').waitFor({ state: 'detached' });
  assert.equal(installedState(suite.appliance, 'demo-beta').version, '');
});

test('a manual install starts the package when asked to, and says it runs', async () => {
  uninstall('demo-beta');
  const { page } = await pages.signedIn();
  await page.getByRole('link', { name: 'Manual install' }).click();
  await page.getByLabel('Package file').setInputFiles(suite.appliance.file('/volume1/public/packages/demo-beta.kpk'));
  await page.getByRole('button', { name: 'Upload' }).click();
  const dialog = page.getByRole('dialog', { name: 'Install Demo Beta' });
  await dialog.getByRole('button', { name: 'Next' }).click();
  const start = dialog.getByRole('checkbox', { name: 'Start Demo Beta once it is installed' });
  assert.ok(await start.isChecked());
  await screenshot(page, 'manual-install-start');
  await dialog.getByRole('button', { name: 'Install', exact: true }).click();
  await dialog.getByText('Demo Beta 3.0.0-beta1 is installed and running.').waitFor({ timeout: 60_000 });
  assert.deepEqual(installedState(suite.appliance, 'demo-beta'), { version: '3.0.0-beta1', running: true });
  uninstall('demo-beta');
});
