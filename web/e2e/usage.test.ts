// What each package uses, on the page: the installed list and a package's
// details show the CPU time and memory read from its control group with its
// limit, and a package that has not run since the appliance started says
// "not measured" with the reason instead of a 0.

import { test } from 'node:test';
import assert from 'node:assert/strict';
import { kConfinable } from './appliance.ts';
import { checkAccessibility, screenshot } from './browser.ts';
import { row } from './screens.ts';
import { pagesPerTest, useSuite } from './suite.ts';

const suite = useSuite({ prepare: (appliance) => appliance.agreeToTerms() });
const pages = pagesPerTest(suite);

test('the list and the details show what a running package uses', async (t) => {
  if (!kConfinable) return t.skip('needs root and the memory and pids controllers');
  const { page } = await pages.signedIn();
  await page.getByRole('heading', { name: 'Installed packages' }).waitFor();
  const line = row(page, 'Demo Web').locator('.usage-line');
  await line.waitFor();
  assert.match(await line.innerText(), /^CPU [\d.]+ s · Memory [\d.]+ (KiB|MiB) of 512 MiB$/);
  await screenshot(page, 'usage-list');
  await checkAccessibility(page, 'usage list');

  await page.getByRole('link', { name: 'Demo Web', exact: true }).click();
  await page.getByRole('heading', { name: 'Demo Web' }).waitFor();
  const facts = page.locator('.details-facts');
  await facts.getByText('CPU time', { exact: true }).waitFor();
  assert.match(await facts.locator('dd.usage-fact').nth(1).innerText(), /of 512 MiB$/);
  assert.equal(await facts.locator('dd.usage-fact').nth(2).innerText(), '256');
  await screenshot(page, 'usage-details');
});

test('a figure the appliance cannot read says "not measured" and why, never 0', async () => {
  // The administrator's switch leaves every package without groups.
  await suite.appliance.withToolSetting('package_cgroups="no"', async () => {
    const { page } = await pages.signedIn();
    await page.getByRole('heading', { name: 'Installed packages' }).waitFor();
    const line = row(page, 'Demo Web').locator('.usage-line');
    await line.waitFor();
    assert.equal(await line.innerText(), 'CPU not measured · Memory not measured (turned off (package_cgroups in pkgtool.conf))');
    await screenshot(page, 'usage-not-measured');
  });
});
