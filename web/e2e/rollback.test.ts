// Upgrades that do not work and going back to an earlier version, through
// the page: an upgrade whose health check fails is undone by the package
// tool and the upgrade dialog says so in words, with the failing step and
// the package's last log lines; the package's page shows the version an
// upgrade kept, rolls back to it after a confirmation that says the newer
// version's data is kept, and undoes the rollback the same way; it also
// says when an automatic update will not try a version again.
//
// Each test builds the demo-web versions it needs (one major version above
// the installed one), so no test depends on what another left installed.

import { test } from 'node:test';
import assert from 'node:assert/strict';
import { readFileSync, readlinkSync, rmSync, writeFileSync } from 'node:fs';
import type { Locator, Page } from 'playwright-core';
import { checkAccessibility, screenshot } from './browser.ts';
import { buildSample, installedState, offerInVendorCatalogue } from './published.ts';
import { row, shown } from './screens.ts';
import { pagesPerTest, useSuite } from './suite.ts';

const suite = useSuite({ prepare: (appliance) => appliance.agreeToTerms() });
const pages = pagesPerTest(suite);

// The next major version of demo-web, built with `files` added.
function nextDemoWeb(files: Record<string, string> = {}): { from: string; to: string; kpk: string } {
  const from = installedState(suite.appliance, 'demo-web').version;
  const to = `${Number(from.split('.')[0]) + 1}.0.0-0001`;
  const kpk = buildSample(suite.appliance, 'demo-web-update', { package: 'demo-web', version: to }, files);
  return { from, to, kpk };
}

// Opens the upgrade dialog from the installed list and goes through the
// wizard's pages, whichever it has, to its summary's Upgrade button.
async function upgradeFromInstalledList(page: Page, from: string, to: string): Promise<Locator> {
  await page.getByRole('heading', { name: 'Installed packages' }).waitFor();
  await row(page, 'Demo Web').getByRole('button', { name: `Upgrade Demo Web to ${to}` }).click();
  const dialog = page.getByRole('dialog', { name: `Upgrade Demo Web from ${from} to ${to}` });
  await dialog
    .getByRole('button', { name: 'Next' })
    .waitFor({ timeout: 60_000 })
    .catch(async () => assert.fail(`the wizard did not come; the dialog: ${await shown(dialog)}`));
  const upgrade = dialog.getByRole('button', { name: 'Upgrade', exact: true });
  for (let step = 0; step < 6 && !(await upgrade.isVisible()); ++step) await dialog.getByRole('button', { name: 'Next' }).click();
  await upgrade.click();
  return dialog;
}

async function openDetails(page: Page): Promise<void> {
  await page.getByRole('heading', { name: 'Installed packages' }).waitFor();
  await row(page, 'Demo Web').getByRole('link', { name: 'Demo Web', exact: true }).click();
  await page.getByRole('heading', { name: 'Demo Web', level: 1 }).waitFor();
}

function keptRegion(page: Page): Locator {
  return page.getByRole('region', { name: 'Earlier version' });
}

// Rolls back from the details screen through its confirmation; the
// confirmation's words are checked and, once, photographed.
async function rollBackFromDetails(page: Page, from: string, to: string, shot?: string): Promise<void> {
  await keptRegion(page).getByRole('button', { name: `Roll back to ${to}` }).click();
  const confirm = page.getByRole('dialog', { name: `Roll back Demo Web to ${to}?` });
  await confirm.getByText(`The data ${from} has written is not lost: it is kept with ${from}, so you can undo the rollback by rolling back again.`).waitFor();
  if (shot) {
    await screenshot(page, shot);
    await checkAccessibility(page, 'rollback confirmation');
  }
  await confirm.getByRole('button', { name: 'Roll back', exact: true }).click();
  await keptRegion(page)
    .getByText(new RegExp(`^Demo Web was rolled back from ${from.replace(/\./g, '\\.')} to ${to.replace(/\./g, '\\.')} on .*roll back again to undo it\\.$`))
    .waitFor({ timeout: 60_000 });
  await page.getByText(`Version ${to}`).waitFor();
}

test('an upgrade whose health check fails is undone, and the dialog says which step failed with the last lines of the log', async () => {
  const { from, to, kpk } = nextDemoWeb({
    'scripts/health': '#!/bin/sh\necho "changelog page: no answer"\nexit 1\n',
  });
  await offerInVendorCatalogue(suite.appliance, kpk, `demo-web-${to}.kpk`);
  const { page } = await pages.signedIn();
  const dialog = await upgradeFromInstalledList(page, from, to);

  const alert = dialog.getByRole('alert');
  await alert.getByText(`The upgrade of Demo Web to ${to} did not work and was undone: Demo Web ${from} was put back.`).waitFor({ timeout: 90_000 });
  await alert.getByText(`The upgrade to ${to} failed its health check; ${from} and its data were restored.`).waitFor();
  await alert.getByText("The last lines of Demo Web's log:").waitFor();
  await dialog.getByText(`Demo Web ${from} is installed and running.`).waitFor();
  assert.equal(await dialog.getByText('The package could not be installed.').count(), 0, 'not a generic failure');
  await screenshot(page, 'upgrade-restored');
  await checkAccessibility(page, 'upgrade dialog, restored');
  assert.deepEqual(installedState(suite.appliance, 'demo-web'), { version: from, running: true });
});

test("a rollback from the package's page, then its undo", async () => {
  const { from, to, kpk } = nextDemoWeb();
  // From the vendor's catalogue, where demo-web came from.
  await offerInVendorCatalogue(suite.appliance, kpk, `demo-web-${to}.kpk`);
  suite.appliance.kivoctl('install-server', 'demo-web');
  assert.deepEqual(installedState(suite.appliance, 'demo-web'), { version: to, running: true });
  const { page } = await pages.signedIn();
  await openDetails(page);
  await keptRegion(page)
    .getByText(new RegExp(`^Demo Web ${from.replace(/\./g, '\\.')} is kept with its data: it was replaced on .+, and its copy takes [0-9.]+ (KB|MB)\\.$`))
    .waitFor();
  await screenshot(page, 'details-kept-version');

  await rollBackFromDetails(page, to, from, 'rollback-confirm');
  assert.deepEqual(installedState(suite.appliance, 'demo-web'), { version: from, running: true });
  // The outcome lives on the appliance: a reloaded page still tells it.
  await page.reload();
  await keptRegion(page).getByText(`Demo Web was rolled back from ${to} to ${from}`, { exact: false }).waitFor();
  await keptRegion(page).getByText(`Demo Web ${to} is kept with its data`, { exact: false }).waitFor();
  await screenshot(page, 'details-rolled-back');

  await rollBackFromDetails(page, from, to);
  assert.deepEqual(installedState(suite.appliance, 'demo-web'), { version: to, running: true });

  await keptRegion(page).getByRole('button', { name: 'Drop copy' }).click();
  const confirm = page.getByRole('dialog', { name: `Drop the copy of Demo Web ${from}?` });
  await confirm.getByRole('button', { name: 'Drop copy' }).click();
  await keptRegion(page).getByText(`The copy of Demo Web ${from} was dropped`, { exact: false }).waitFor();
  await keptRegion(page).getByText('No earlier version of Demo Web is kept.').waitFor();
  // With the copy gone, the last rollback is no longer offered as undoable.
  await keptRegion(page).getByText(`Demo Web was rolled back from ${from} to ${to}`, { exact: false }).waitFor();
  assert.equal(await keptRegion(page).getByText('roll back again to undo it', { exact: false }).count(), 0);
  assert.match(suite.appliance.kivoctl('revisions', 'demo-web'), /no earlier version of demo-web is kept/);
});

test('the package page says when an automatic update will not try a version again', async () => {
  const installed = installedState(suite.appliance, 'demo-web').version;
  const failed = `${Number(installed.split('.')[0]) + 1}.0.0-0001`;
  const record = readlinkSync(suite.appliance.file('/var/packages/demo-web'));
  const failures = { 'demo-web': { version: failed, time: 1_700_000_000, code: 305, reason: `The upgrade to ${failed} failed its health check`, record } };
  suite.appliance.replace('/usr/kivo/etc/packages/autoupdate-failures.json', JSON.stringify(failures));
  const { page } = await pages.signedIn();
  await openDetails(page);
  await keptRegion(page)
    .getByText(
      new RegExp(
        `^An automatic update to Demo Web ${failed.replace(/\./g, '\\.')} failed on .+ \\(The upgrade to .+ failed its health check\\), and ${installed.replace(/\./g, '\\.')} was put back\\. Automatic updates will not try .+ again; they wait for a newer version\\.$`,
      ),
    )
    .waitFor();
  await screenshot(page, 'details-autoupdate-failed');
});

test('a volume without room for the safety copy: the dialog says so, and the administrator may upgrade without it', async () => {
  const { from, to, kpk } = nextDemoWeb();
  await offerInVendorCatalogue(suite.appliance, kpk, `demo-web-${to}.kpk`);
  // More than 3 MiB of data on a volume that has 2 MiB free.
  const big = suite.appliance.file('/volume1/@appdata/demo-web/big-data');
  writeFileSync(big, Buffer.alloc(3 << 20, 7));
  const volumes = '/etc/kivo/volumes.json';
  const before = readFileSync(suite.appliance.file(volumes), 'utf8');
  suite.appliance.replace(volumes, JSON.stringify([{ path: '/volume1', status: 'normal', cap_bytes: 2 << 20, brick: false }]));
  try {
    const { page } = await pages.signedIn();
    const dialog = await upgradeFromInstalledList(page, from, to);
    const alert = dialog.getByRole('alert');
    await alert
      .getByText(/^The upgrade of demo-web needs [3-9] MiB for a safety copy of its data besides .+ and \/volume1 has 2 MiB free\. Nothing was changed\./)
      .waitFor({ timeout: 90_000 })
      .catch(async () => assert.fail(`the dialog: ${await shown(dialog)}`));
    assert.deepEqual(installedState(suite.appliance, 'demo-web'), { version: from, running: true });
    await screenshot(page, 'upgrade-no-room-for-copy');
    await checkAccessibility(page, 'upgrade dialog, no room for the copy');
    await dialog.getByRole('button', { name: 'Upgrade without a safety copy' }).click();
    await dialog.getByText(`Demo Web ${to} is installed and running.`).waitFor({ timeout: 90_000 });
    assert.deepEqual(installedState(suite.appliance, 'demo-web'), { version: to, running: true });
    assert.match(suite.appliance.kivoctl('revisions', 'demo-web'), /no earlier version of demo-web is kept/);
  } finally {
    suite.appliance.replace(volumes, before);
    rmSync(big, { force: true });
  }
});
