// When automatic updates run, against a real appliance: a package held on
// its page is left alone by a real run of `kivoctl auto-update`, and the
// settings set the maintenance window and show the last run, each
// package's outcome and when updates run next.

import { test } from 'node:test';
import assert from 'node:assert/strict';
import { readFileSync } from 'node:fs';
import { checkAccessibility, screenshot } from './browser.ts';
import { pagesPerTest, useSuite } from './suite.ts';

const suite = useSuite({ prepare: (appliance) => appliance.agreeToTerms() });
const pages = pagesPerTest(suite);

test('a held package is left alone, and the settings set the window and show the last run', async () => {
  const { page } = await pages.signedIn();
  await page.goto(new URL('#/settings', suite.appliance.url).href);
  await page.getByRole('radio', { name: 'Update every package automatically' }).check();
  await page.getByRole('button', { name: 'Save settings' }).click();
  await page.getByText('Settings saved.').waitFor();

  // Hold Demo Notes on its page.
  await page.goto(new URL('#/package/demo-notes', suite.appliance.url).href);
  const hold = page.getByRole('region', { name: 'Automatic updates' });
  await hold.getByText('Demo Notes is not held').waitFor();
  await hold.getByRole('button', { name: 'Hold until lifted' }).click();
  await hold.getByText('Demo Notes is held at its version until the hold is lifted (set by admin').waitFor();
  await screenshot(page, 'package-held');
  await checkAccessibility(page, 'package-held');

  // A real run leaves it alone and says so.
  let said = '';
  try {
    said = suite.appliance.kivoctl('auto-update');
  } catch (e) {
    // Another package's upgrade may fail; the run still records every outcome.
    said = String((e as { stdout?: string }).stdout ?? e);
  }
  assert.match(said, /^demo-notes: skipped: held until lifted$/m);

  // The settings: the last run with each package's outcome, then a window.
  await page.goto(new URL('#/settings', suite.appliance.url).href);
  const section = page.getByRole('region', { name: 'When automatic updates run' });
  await section.getByRole('row', { name: /demo-notes Held skipped: held until lifted/ }).waitFor();
  assert.notEqual(await section.getByTestId('last-run').textContent(), 'Never');
  assert.equal(await section.getByTestId('next-run').textContent(), 'Whenever the scheduler starts them');
  await section.getByRole('radio', { name: 'Only on these days, between these hours' }).check();
  await section.getByRole('checkbox', { name: 'Monday' }).check();
  await section.getByRole('checkbox', { name: 'Thursday' }).check();
  await section.getByLabel('From').fill('02:00');
  await section.getByLabel('to', { exact: true }).fill('05:00');
  await section.getByRole('spinbutton').fill('45');
  await section.getByRole('button', { name: 'Save window' }).click();
  await section.getByText('Maintenance window saved.').waitFor();
  const stored = readFileSync(suite.appliance.file('/etc/kivo/autoupdate.conf'), 'utf8');
  assert.match(stored, /^window_days="mon,thu"$/m);
  assert.match(stored, /^window_start="02:00"$/m);
  assert.match(stored, /^window_end="05:00"$/m);
  assert.match(stored, /^random_delay_minutes="45"$/m);
  assert.notEqual(await section.getByTestId('next-run').textContent(), 'Whenever the scheduler starts them');
  await section.scrollIntoViewIfNeeded();
  await screenshot(page, 'settings-update-window');
  await checkAccessibility(page, 'settings-update-window');
});
