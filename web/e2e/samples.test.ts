// The sample packages as the page shows them: each with an icon of its own
// (drawn by kivoctl when examples/build.sh builds them), and the Demo
// Wizard's uninstall pages, which say what is deleted and what a kept copy
// is.

import { test } from 'node:test';
import assert from 'node:assert/strict';
import type { Page } from 'playwright-core';
import { checkAccessibility, screenshot } from './browser.ts';
import { pagesPerTest, useSuite } from './suite.ts';

// The beta channel, so that the catalogue offers every sample (Demo Beta too).
const suite = useSuite({
  prepare: (appliance) => {
    appliance.agreeToTerms();
    appliance.setUpdateChannel('beta');
  },
});
const pages = pagesPerTest(suite);

// The pictures of the images `selector` finds, by the name of the list item
// each stands in, as the browser received them (base64 of their bytes).
async function iconsByName(page: Page, selector: string): Promise<Map<string, string>> {
  await page.waitForFunction((s) => Array.from(document.querySelectorAll<HTMLImageElement>(s)).every((i) => i.complete), selector);
  // No function is named inside: the test runner's compiler would wrap it
  // in a helper that the page does not have.
  const pairs = await page.evaluate(
    async (s) =>
      Promise.all(
        Array.from(document.querySelectorAll<HTMLImageElement>(s)).map(async (img) => {
          const name = img.closest('li')?.querySelector('h3, a')?.textContent?.trim() ?? img.src;
          const bytes = new Uint8Array(await (await fetch(img.src)).arrayBuffer());
          return [name, btoa(Array.from(bytes, (b) => String.fromCharCode(b)).join(''))] as [string, string];
        }),
      ),
    selector,
  );
  return new Map(pairs);
}

function expectAllDifferent(icons: Map<string, string>, where: string): void {
  const names = [...icons.keys()];
  for (const [i, a] of names.entries()) {
    for (const b of names.slice(i + 1)) assert.notEqual(icons.get(a), icons.get(b), `${where}: ${a} and ${b} show the same icon`);
  }
}

test('each sample package has an icon of its own, in the catalogue and in the installed list', async () => {
  const { page } = await pages.signedIn();
  await page.getByRole('list', { name: 'Installed packages' }).getByRole('link', { name: 'Demo Notes', exact: true }).waitFor();
  const installed = await iconsByName(page, 'li img');
  assert.deepEqual([...installed.keys()].sort(), ['Demo Notes', 'Demo Web']);
  expectAllDifferent(installed, 'installed list');

  await page.goto(new URL('#/catalogue', suite.appliance.url).href);
  await page.getByRole('heading', { name: 'Recommended' }).waitFor();
  const offered = await iconsByName(page, 'li img');
  assert.ok(offered.size >= 6, `icons of ${[...offered.keys()]}`);
  expectAllDifferent(offered, 'catalogue');
  await screenshot(page, 'sample-icons');
});

test("the Demo Wizard's uninstall pages say that its data goes and that it can say its greeting once more", async () => {
  suite.appliance.kivoctl('install', suite.appliance.file('/volume1/public/packages/demo-wizard.kpk'), '--wizard', '{"greeting":"Ahoy"}');
  const { page } = await pages.signedIn();
  const row = page.getByRole('listitem').filter({ has: page.getByRole('link', { name: 'Demo Wizard', exact: true }) });
  await row.getByRole('button', { name: 'Uninstall Demo Wizard' }).click();
  const dialog = page.getByRole('dialog', { name: 'Uninstall Demo Wizard' });
  await dialog.getByText('deletes the data it keeps').waitFor();
  await dialog.getByRole('button', { name: 'Continue anyway' }).click();
  await dialog.getByText('The greeting is part of the data Demo Wizard keeps, which is deleted with it.', { exact: false }).waitFor();
  await dialog.getByText('Demo Wizard can say it once more as it goes.', { exact: false }).waitFor();
  await dialog.getByRole('checkbox', { name: "Keep a copy: say it in the uninstall's messages" }).waitFor();
  await screenshot(page, 'demo-wizard-uninstall-wizard');
  await checkAccessibility(page, 'demo-wizard uninstall wizard');
});
