// How each package is confined, on the page: the installed list has a short
// badge and a package's details the full words, read from the package's
// confinement record through the Usage API. A package whose control groups
// were turned off shows as partly confined, with what is missing and why.

import { test } from 'node:test';
import assert from 'node:assert/strict';
import { readFileSync } from 'node:fs';
import { kConfinable } from './appliance.ts';
import type { Page } from 'playwright-core';
import { checkAccessibility, screenshot } from './browser.ts';
import { row } from './screens.ts';
import { pagesPerTest, useSuite } from './suite.ts';

const suite = useSuite({ prepare: (appliance) => appliance.agreeToTerms() });
const pages = pagesPerTest(suite);

// The record as the package tool wrote it.
function record(id: string): { state: string; missing: { what: string; reason: string }[] } {
  return JSON.parse(readFileSync(suite.appliance.file(`/var/packages/${id}/confinement`), 'utf8'));
}

async function openDetails(page: Page, name: string): Promise<void> {
  await page.getByRole('heading', { name: 'Installed packages' }).waitFor();
  await page.getByRole('link', { name, exact: true }).click();
  await page.getByRole('heading', { name }).waitFor();
}

test('a confined package says so in the list and in its details', async (t) => {
  if (!kConfinable) return t.skip('needs root and the memory and pids controllers');
  const state = record('demo-web').state;
  if (state !== 'confined') return t.skip(`demo-web is not fully confined here: ${JSON.stringify(record('demo-web'))}`);
  const { page } = await pages.signedIn();
  await page.getByRole('heading', { name: 'Installed packages' }).waitFor();
  const badge = row(page, 'Demo Web').locator('.badge.confinement');
  await badge.waitFor();
  assert.equal(await badge.innerText(), 'Confined');
  assert.equal(await badge.getAttribute('title'), 'Runs as its own user, confined');
  await screenshot(page, 'confinement-list');

  await openDetails(page, 'Demo Web');
  const facts = page.locator('.details-facts');
  await facts.locator('dd.confinement-fact').waitFor();
  assert.equal(await facts.locator('dd.confinement-fact').innerText(), 'Runs as its own user, confined');
  assert.match(await facts.locator('dd.confinement-user').innerText(), /^pkg-demo-web \(uid \d+\)$/);
  await screenshot(page, 'confinement-confined');
  await checkAccessibility(page, 'confinement details');
});

test('a package without its control groups is partly confined, with what and why', async (t) => {
  if (!kConfinable) return t.skip('needs root and the memory and pids controllers');
  // The administrator's switch leaves every package without groups; the
  // package tool records it at the package's next run (here: kivoctl confine).
  try {
    await suite.appliance.withToolSetting('package_cgroups="no"', async () => {
      suite.appliance.kivoctl('confine', 'demo-notes');
      assert.equal(record('demo-notes').state, 'partly');
      const { page } = await pages.signedIn();
      await page.getByRole('heading', { name: 'Installed packages' }).waitFor();
      const badge = row(page, 'Demo Notes').locator('.badge.confinement');
      await badge.waitFor();
      assert.equal(await badge.innerText(), 'Partly confined');

      await openDetails(page, 'Demo Notes');
      const fact = page.locator('.details-facts dd.confinement-fact');
      await fact.waitFor();
      assert.equal(
        await fact.innerText(),
        'Partly confined: the memory limit, the process limit and the CPU time measurement were not applied because turned off (package_cgroups in pkgtool.conf)',
      );
      await screenshot(page, 'confinement-partly');
    });
  } finally {
    suite.appliance.kivoctl('confine', 'demo-notes');
  }
});
