// The Activity screen and a package's history against a real appliance:
// what kivoctl, the page and a failed sign-in did is listed newest first
// with who, from where and how it ended; the filters narrow it (a value the
// appliance refuses is said in words); the export gives the same entries as
// CSV and JSON; a package's page shows its own history.

import { test } from 'node:test';
import assert from 'node:assert/strict';
import { readFileSync } from 'node:fs';
import type { Page } from 'playwright-core';
import { checkAccessibility, screenshot } from './browser.ts';
import { waitUntil } from './published.ts';
import { pagesPerTest, useSuite } from './suite.ts';

const suite = useSuite({
  prepare: async (appliance) => {
    appliance.agreeToTerms();
    // demo-notes stopped and started again from the command line.
    appliance.kivoctl('stop', 'demo-notes');
    appliance.kivoctl('start', 'demo-notes');
    // Someone guessing a password from this machine.
    const login = await fetch(new URL('webapi/entry.cgi', appliance.url), {
      method: 'POST',
      body: new URLSearchParams({ api: 'KIVO.API.Auth', version: '1', method: 'login', account: 'intruder', passwd: 'guess-1234' }),
    });
    assert.equal(((await login.json()) as { success: boolean }).success, false);
  },
});
const pages = pagesPerTest(suite);

async function openActivity(page: Page): Promise<void> {
  await page.getByRole('navigation', { name: 'Sections' }).getByRole('link', { name: 'Activity' }).click();
  await page.getByRole('heading', { name: 'Activity', level: 1 }).waitFor();
  await page.getByRole('table', { name: 'Activity, newest first' }).waitFor();
}

function rows(page: Page) {
  return page.getByRole('table', { name: 'Activity, newest first' }).locator('tbody tr');
}

// Waits until the table's rows are as many as `patterns` and each matches
// its own, in order.
async function expectRows(page: Page, patterns: RegExp[]): Promise<void> {
  let texts: string[] = [];
  try {
    await waitUntil('the listed entries', async () => {
      texts = await rows(page).allTextContents();
      return texts.length === patterns.length && patterns.every((p, i) => p.test(texts[i]));
    }, 10);
  } catch (e) {
    assert.fail(`${(e as Error).message}; listed:\n${texts.join('\n')}`);
  }
}

// Applies the filters as typed and waits for the entries they select.
async function apply(page: Page, patterns: RegExp[]): Promise<void> {
  await page.getByRole('button', { name: 'Apply filters' }).click();
  await expectRows(page, patterns);
}

test('the Activity screen lists who did what, filters it and exports it', async () => {
  const { page } = await pages.signedIn();
  await openActivity(page);
  // Newest first: this page's own sign-in, then the failed one, then the
  // command line's start and stop of demo-notes.
  const texts = await rows(page).allTextContents();
  assert.match(texts[0], /^.*admin.*web, from 127\.0\.0\.1.*Sign in.*Succeeded/);
  assert.match(texts[1], /intruder.*web, from 127\.0\.0\.1.*Failed sign-in.*Failed/);
  assert.match(texts[2], /command line.*Start.*demo-notes.*Succeeded/);
  assert.match(texts[3], /command line.*Stop.*demo-notes.*Succeeded/);
  await checkAccessibility(page, 'activity');

  // Only what failed: the guessed password.
  await page.getByLabel('Outcome', { exact: true }).selectOption({ label: 'Failed' });
  await apply(page, [/intruder.*Failed sign-in/]);
  // And one package's starts.
  await page.getByLabel('Outcome', { exact: true }).selectOption({ label: 'Any' });
  await page.getByLabel('Package', { exact: true }).fill('demo-notes');
  await page.getByLabel('Operation', { exact: true }).selectOption({ label: 'Start' });
  await apply(page, [/command line.*Start.*demo-notes.*Succeeded/]);
  await screenshot(page, 'activity-filtered');

  // The export gives what the filters select.
  const [csv] = await Promise.all([page.waitForEvent('download'), page.getByRole('button', { name: 'Export CSV' }).click()]);
  assert.equal(csv.suggestedFilename(), 'activity.csv');
  const lines = readFileSync(await csv.path(), 'utf8').trimEnd().split('\r\n');
  assert.match(lines[0], /^"id","started"/);
  assert.equal(lines.length, 2, lines.join('\n'));
  assert.match(lines[1], /"Control\.start","demo-notes"/);
  const [json] = await Promise.all([page.waitForEvent('download'), page.getByRole('button', { name: 'Export JSON' }).click()]);
  const entries = JSON.parse(readFileSync(await json.path(), 'utf8')) as { operation: string; packages: string[]; origin: string }[];
  assert.deepEqual(
    entries.map((e) => [e.operation, e.packages, e.origin]),
    [['Control.start', ['demo-notes'], 'kivoctl']],
  );

  // A value the appliance refuses, and a range that ends before it begins.
  await page.getByLabel('Package', { exact: true }).fill("demo' OR 1=1 --");
  await page.getByRole('button', { name: 'Apply filters' }).click();
  await page.getByRole('alert').filter({ hasText: '"package" is not valid' }).waitFor();
  await page.getByLabel('Package', { exact: true }).fill('');
  await page.getByLabel('From', { exact: true }).fill('2030-01-02T10:00');
  await page.getByLabel('To', { exact: true }).fill('2030-01-01T10:00');
  await page.getByRole('button', { name: 'Apply filters' }).click();
  await page.getByRole('alert').filter({ hasText: '“From” is after “To”.' }).waitFor();

  await page.getByRole('button', { name: 'Clear' }).click();
  await page.getByRole('status').filter({ hasText: /^1–\d+ of \d+$/ }).waitFor();
  await screenshot(page, 'activity');
});

test("a package's page shows its own history", async () => {
  const { page } = await pages.signedIn();
  await page.goto(new URL('#/package/demo-notes', suite.appliance.url).href);
  const history = page.getByRole('table', { name: 'History of demo-notes, newest first' });
  await history.waitFor();
  const texts = await history.locator('tbody tr').allTextContents();
  // The start and the stop from the command line, newest first, and the
  // install from the vendor's server that made the demo.
  assert.match(texts[0], /command line.*Start.*Succeeded/);
  assert.match(texts[1], /command line.*Stop.*Succeeded/);
  assert.ok(
    texts.some((t) => /Install or upgrade.*Succeeded/.test(t)),
    texts.join('\n'),
  );
  await page.getByRole('heading', { name: 'History' }).scrollIntoViewIfNeeded();
  await checkAccessibility(page, 'package-history');
  await screenshot(page, 'package-history');
});
