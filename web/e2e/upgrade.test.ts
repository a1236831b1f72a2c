// Upgrading an installed package from its package server, beside the
// packages that need it: the catalogue's, the installed list's and the
// package page's Upgrade open the same dialog, titled with both versions and
// showing what the new version says about itself; an upgrade the running
// dependents accept goes ahead while they run; one that would break a
// running dependent says which and why, and offers to stop it, upgrade and
// start it again, then says what each step did and what runs now.
//
// Each test offers a demo-web newer than the one installed (built at test
// time), so no test depends on what another upgraded.

import { test } from 'node:test';
import assert from 'node:assert/strict';
import type { Locator, Page } from 'playwright-core';
import { checkAccessibility, screenshot } from './browser.ts';
import { buildSample, installedState, offerInVendorCatalogue, waitUntil } from './published.ts';
import { card, openCatalogue, row, shown } from './screens.ts';
import { pagesPerTest, useSuite } from './suite.ts';

const suite = useSuite({ prepare: (appliance) => appliance.agreeToTerms() });
const pages = pagesPerTest(suite);

// Offers a demo-web one major version above the installed one (built from
// the sample of its update, "now with a changelog page"), and answers the
// versions before and after.
async function offerNextDemoWeb(): Promise<{ from: string; to: string; major: number }> {
  const from = installedState(suite.appliance, 'demo-web').version;
  const major = Number(from.split('.')[0]) + 1;
  const to = `${major}.0.0-0001`;
  const kpk = buildSample(suite.appliance, 'demo-web-update', { package: 'demo-web', version: to });
  await offerInVendorCatalogue(suite.appliance, kpk, `demo-web-${to}.kpk`);
  return { from, to, major };
}

// Goes through the upgrade dialog's wizard (volume, summary) to "Upgrade".
async function runWizard(dialog: Locator): Promise<void> {
  await dialog
    .getByText('Install on volume')
    .waitFor({ timeout: 60_000 })
    .catch(async () => assert.fail(`the wizard did not come; the dialog: ${await shown(dialog)}`));
  await dialog.getByRole('button', { name: 'Next' }).click();
  await dialog.getByText('Summary').waitFor();
  await dialog.getByRole('button', { name: 'Upgrade', exact: true }).click();
}

function upgradeDialog(page: Page, from: string, to: string): Locator {
  return page.getByRole('dialog', { name: `Upgrade Demo Web from ${from} to ${to}` });
}

test('the catalogue upgrades Demo Web while Demo Notes runs, titled with both versions and showing what the new one says', async () => {
  const { from, to } = await offerNextDemoWeb();
  assert.ok(installedState(suite.appliance, 'demo-notes').running, 'Demo Notes runs before the upgrade');
  const { page } = await pages.signedIn();
  await openCatalogue(page, suite.appliance);

  await card(page, 'Demo Web').getByRole('button', { name: 'Upgrade Demo Web' }).click();
  const dialog = upgradeDialog(page, from, to);
  await dialog.getByRole('region', { name: `About ${to}` }).getByText('now with a changelog page').waitFor();
  await dialog.getByText('Demo Notes needs Demo Web 1.0 or later.').waitFor();
  await dialog.getByText('Install on volume').waitFor({ timeout: 30_000 });
  await screenshot(page, 'upgrade-dialog');
  await checkAccessibility(page, 'upgrade dialog');
  await runWizard(dialog);

  await dialog.getByText(`Demo Web is upgraded to ${to}.`).waitFor({ timeout: 60_000 });
  await dialog.getByText(`Demo Web ${to} is installed and running.`).waitFor();
  await dialog.getByText('Demo Notes still runs.').waitFor();
  assert.equal(await dialog.getByText(/cannot be installed/).count(), 0);
  await screenshot(page, 'upgrade-dialog-done');
  assert.deepEqual(installedState(suite.appliance, 'demo-web'), { version: to, running: true });
  assert.ok(installedState(suite.appliance, 'demo-notes').running, 'Demo Notes still runs');

  await dialog.getByRole('button', { name: 'Close' }).click();
  await card(page, 'Demo Web').getByText('Installed, running').waitFor();
  assert.equal(await card(page, 'Demo Web').getByRole('button', { name: 'Upgrade Demo Web' }).count(), 0);
});

test('the installed list offers the upgrade as a button that opens the same dialog', async () => {
  const { from, to } = await offerNextDemoWeb();
  const { page } = await pages.signedIn();
  await page.getByRole('heading', { name: 'Installed packages' }).waitFor();

  await row(page, 'Demo Web').getByRole('button', { name: `Upgrade Demo Web to ${to}` }).click();
  const dialog = upgradeDialog(page, from, to);
  await runWizard(dialog);
  await dialog.getByText(`Demo Web is upgraded to ${to}.`).waitFor({ timeout: 60_000 });
  await dialog.getByRole('button', { name: 'Close' }).click();

  await row(page, 'Demo Web').getByText(to).waitFor();
  // What is offered is asked again after the upgrade: nothing newer now.
  await row(page, 'Demo Web').getByRole('button', { name: /^Upgrade/ }).waitFor({ state: 'detached' });
  assert.deepEqual(installedState(suite.appliance, 'demo-web'), { version: to, running: true });
});

test("the package's page offers the upgrade as a button that opens the same dialog", async () => {
  const { from, to } = await offerNextDemoWeb();
  const { page } = await pages.signedIn();
  await page.getByRole('link', { name: 'Demo Web', exact: true }).click();
  await page.getByRole('heading', { name: 'Demo Web' }).waitFor();

  await page.getByRole('button', { name: `Upgrade Demo Web to ${to}` }).click();
  const dialog = upgradeDialog(page, from, to);
  await runWizard(dialog);
  await dialog.getByText(`Demo Web is upgraded to ${to}.`).waitFor({ timeout: 60_000 });
  await dialog.getByRole('button', { name: 'Close' }).click();

  await page.getByText(`Version ${to}`).waitFor();
  await page.getByRole('button', { name: /^Upgrade/ }).waitFor({ state: 'detached' });
});

test('an upgrade that would break a running package names it and what it needs, and stops it, upgrades and starts it again', async () => {
  // A package that runs and needs a demo-web older than the one offered.
  const current = Number(installedState(suite.appliance, 'demo-web').version.split('.')[0]);
  const pinned = buildSample(suite.appliance, 'demo-notes', {
    package: 'demo-pinned',
    version: '1.0',
    displayname: 'Demo Pinned Notes',
    description: 'Keeps notes; works only with an older Demo Web.',
    install_dep_packages: `demo-web<${current + 1}`,
  });
  suite.appliance.kivoctl('install', pinned, '--run');
  try {
    assert.ok(installedState(suite.appliance, 'demo-pinned').running);
    const { from, to, major } = await offerNextDemoWeb();
    const { page } = await pages.signedIn();
    await openCatalogue(page, suite.appliance);

    await card(page, 'Demo Web').getByRole('button', { name: 'Upgrade Demo Web' }).click();
    const dialog = upgradeDialog(page, from, to);
    await runWizard(dialog);
    const refusal = dialog.getByRole('alert');
    await refusal
      .getByText(`Demo Web ${to} was not installed: Demo Pinned Notes runs and needs Demo Web older than ${major}, which ${to} is not.`)
      .waitFor({ timeout: 60_000 });
    await dialog.getByText(`Demo Web ${from} is installed and running.`).waitFor();
    assert.equal(await dialog.getByText(/cannot be installed/).count(), 0);
    await screenshot(page, 'upgrade-dialog-breaking');
    await checkAccessibility(page, 'upgrade dialog, breaking');
    assert.equal(installedState(suite.appliance, 'demo-web').version, from);

    await dialog.getByRole('button', { name: 'Stop Demo Pinned Notes, upgrade, start it again' }).click();
    const steps = dialog.getByRole('list', { name: 'Steps' });
    await steps.getByText('Stop Demo Pinned Notes: Done. Demo Pinned Notes was stopped.').waitFor({ timeout: 60_000 });
    await steps.getByText(`Upgrade Demo Web to ${to}: Done. Demo Web ${to} is installed.`).waitFor({ timeout: 60_000 });
    // The new version does not suit it: it cannot start, and the dialog says so.
    await steps.getByText(`Start Demo Pinned Notes again: Failed. ${'This package needs other packages that are not installed or not running.'}`).waitFor({ timeout: 30_000 });
    await steps.getByText(`Not installed: Demo Web older than ${major}.`).waitFor();
    await dialog.getByText(`Demo Web ${to} is installed and running.`).waitFor();
    await dialog.getByText('Demo Pinned Notes 1.0 is installed and stopped.').waitFor();
    await screenshot(page, 'upgrade-dialog-breaking-done');
    assert.deepEqual(installedState(suite.appliance, 'demo-web'), { version: to, running: true });
    assert.equal(installedState(suite.appliance, 'demo-pinned').running, false);
  } finally {
    suite.appliance.kivoctl('uninstall', 'demo-pinned');
  }
});

test('an upgrade the running package accepts still goes ahead beside it', async () => {
  // Needs demo-web older than the next major but one: the next one suits it.
  const current = Number(installedState(suite.appliance, 'demo-web').version.split('.')[0]);
  const pinned = buildSample(suite.appliance, 'demo-notes', {
    package: 'demo-pinned',
    version: '1.0',
    displayname: 'Demo Pinned Notes',
    install_dep_packages: `demo-web<${current + 2}`,
  });
  suite.appliance.kivoctl('install', pinned, '--run');
  try {
    const { from, to } = await offerNextDemoWeb();
    const { page } = await pages.signedIn();
    await page.getByRole('heading', { name: 'Installed packages' }).waitFor();
    await row(page, 'Demo Web').getByRole('button', { name: `Upgrade Demo Web to ${to}` }).click();
    const dialog = upgradeDialog(page, from, to);
    await dialog.getByText(`Demo Pinned Notes needs Demo Web older than ${current + 2}.`).waitFor();
    await runWizard(dialog);
    await dialog.getByText(`Demo Web is upgraded to ${to}.`).waitFor({ timeout: 60_000 });
    await dialog.getByText('Demo Pinned Notes still runs.').waitFor();
    await waitUntil('demo-pinned runs', () => installedState(suite.appliance, 'demo-pinned').running, 10);
  } finally {
    suite.appliance.kivoctl('uninstall', 'demo-pinned');
  }
});
