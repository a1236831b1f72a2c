// The installed packages: the list with states and upgrade marks, a
// package's details and log, start and stop through the feasibility check
// (a stop refused while a dependent runs, with the reason shown), and an
// uninstall through the package's own wizard.

import { beforeEach, test } from 'node:test';
import assert from 'node:assert/strict';
import type { Page } from 'playwright-core';
import { checkAccessibility, screenshot } from './browser.ts';
import { row } from './screens.ts';
import { pagesPerTest, useSuite } from './suite.ts';

// The first visit would ask for the terms of service (e2e/settings.test.ts tests that).
const suite = useSuite({ prepare: (appliance) => appliance.agreeToTerms() });
const pages = pagesPerTest(suite);
let page: Page;

// Each test starts signed in on the installed list.
beforeEach(async () => {
  ({ page } = await pages.signedIn());
  await page.getByRole('heading', { name: 'Installed packages' }).waitFor();
});

function statusOf(id: string): string {
  try {
    return suite.appliance.kivoctl('status', id);
  } catch (e) {
    return String((e as { stdout?: string }).stdout ?? e);
  }
}

async function waitForStatus(name: string, label: string): Promise<void> {
  await row(page, name).locator('.badge').getByText(label, { exact: true }).waitFor();
}

test('the list shows each installed package with its state and the upgrade a server offers', async () => {
  await waitForStatus('Demo Web', 'Running');
  await waitForStatus('Demo Notes', 'Running');
  // The vendor's catalogue offers demo-web 1.1.0 and nothing newer for demo-notes.
  await row(page, 'Demo Web').getByRole('button', { name: 'Upgrade Demo Web to 1.1.0-0001' }).waitFor();
  assert.equal(await row(page, 'Demo Notes').getByText(/Upgrade to/).count(), 0);
  // The icon is decorative (the name stands beside it) but must load.
  const icon = await row(page, 'Demo Web').locator('img.package-icon').elementHandle();
  await page.waitForFunction((img) => img instanceof HTMLImageElement && img.complete && img.naturalWidth > 0, icon);
  await screenshot(page, 'installed');
  await checkAccessibility(page, 'installed');

  // Nothing runs, so the page asks the appliance nothing while it is shown.
  const calls: string[] = [];
  const count = (r: { url: () => string }) => r.url().includes('/webapi/') && calls.push(r.url());
  page.on('request', count);
  await new Promise((r) => setTimeout(r, 4000));
  page.off('request', count);
  assert.deepEqual(calls, []);
});

test('a package shows its details, its web address while it runs, what it needs, and its log', async () => {
  await page.getByRole('link', { name: 'Demo Notes', exact: true }).click();
  await page.getByRole('heading', { name: 'Demo Notes' }).waitFor();
  await page.getByText('Keeps notes; needs Demo Web 1.0 or later to run.').waitFor();
  await page.getByRole('link', { name: 'Demo Web', exact: true }).click();

  await page.getByRole('heading', { name: 'Demo Web' }).waitFor();
  const port = suite.appliance.demoWebPort;
  await page.getByText(`A small web service on port ${port}: start it and open its page.`).waitFor();
  await page.getByRole('link', { name: 'KIVO Samples' }).first().waitFor();
  await page.getByRole('link', { name: 'Help' }).waitFor();
  const address = page.getByRole('link', { name: new RegExp(`^http://127\\.0\\.0\\.1:${port}`) });
  assert.equal(await address.getAttribute('href'), `http://127.0.0.1:${port}/`);
  await page.getByText('No other packages.').waitFor();
  const log = page.getByRole('region', { name: 'Log' });
  await log.getByText(`demo-web 1.0.0-0001 serving on port ${port}`).waitFor();
  await screenshot(page, 'package-details');
  await checkAccessibility(page, 'package-details');
  await page.getByRole('link', { name: '← Installed packages' }).click();
});

test('stopping demo-web is refused while demo-notes runs; stopped and started in order it works', async () => {
  await row(page, 'Demo Web').getByRole('button', { name: 'Stop Demo Web' }).click();
  const refusal = page.getByRole('dialog', { name: 'Could not stop Demo Web' });
  await refusal.getByText('Demo Notes runs and needs Demo Web.').waitFor();
  await refusal.getByRole('button', { name: 'Close' }).click();
  assert.match(statusOf('demo-web'), /running/);

  await row(page, 'Demo Notes').getByRole('button', { name: 'Stop Demo Notes' }).click();
  await waitForStatus('Demo Notes', 'Stopped');
  // With its dependent stopped, the stop is allowed after a warning.
  await row(page, 'Demo Web').getByRole('button', { name: 'Stop Demo Web' }).click();
  const confirm = page.getByRole('dialog', { name: 'Stop Demo Web?' });
  await confirm.getByText(/Demo Notes/).waitFor();
  await confirm.getByRole('button', { name: 'Stop anyway' }).click();
  await waitForStatus('Demo Web', 'Stopped');
  assert.doesNotMatch(statusOf('demo-web'), /running/);

  // A start whose dependency is stopped is refused and names it.
  await row(page, 'Demo Notes').getByRole('button', { name: 'Start Demo Notes' }).click();
  const failed = page.getByRole('dialog', { name: 'Could not start Demo Notes' });
  await failed.getByText('Not running: Demo Web.').waitFor();
  await failed.getByRole('button', { name: 'Close' }).click();

  await row(page, 'Demo Web').getByRole('button', { name: 'Start Demo Web' }).click();
  await waitForStatus('Demo Web', 'Running');
  await row(page, 'Demo Notes').getByRole('button', { name: 'Start Demo Notes' }).click();
  await waitForStatus('Demo Notes', 'Running');
  assert.match(statusOf('demo-notes'), /running/);
});

test('a package with an uninstall wizard is removed with the answers given', async () => {
  suite.appliance.kivoctl('install', suite.appliance.file('/volume1/public/packages/demo-wizard.kpk'), '--wizard', '{"greeting":"Ahoy"}', '--run');
  await page.reload();
  await row(page, 'Demo Wizard').getByRole('button', { name: 'Uninstall Demo Wizard' }).click();
  const dialog = page.getByRole('dialog', { name: 'Uninstall Demo Wizard' });
  // The soft reason first, then the package's own page.
  await dialog.getByText('Removing Demo Wizard deletes the data it keeps.').waitFor();
  await dialog.getByRole('button', { name: 'Continue anyway' }).click();
  await dialog.getByRole('group', { name: 'Keep a copy of the greeting?' }).waitFor();
  assert.ok(await dialog.getByRole('checkbox', { name: 'Keep a copy' }).isChecked());
  await screenshot(page, 'uninstall-wizard');
  await checkAccessibility(page, 'uninstall-wizard');
  await dialog.getByRole('button', { name: 'Next' }).click();
  await dialog.getByRole('button', { name: 'Uninstall' }).click();
  await row(page, 'Demo Wizard').waitFor({ state: 'detached' });
  assert.doesNotMatch(suite.appliance.kivoctl('list'), /demo-wizard/);
});
