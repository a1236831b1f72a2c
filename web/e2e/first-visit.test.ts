// What a browser meets on its first visit: the page, its icon and its
// script, with no console error and no failed request, the script sent
// gzip-compressed; and the words that close a visit: signing out says so.

import { test } from 'node:test';
import assert from 'node:assert/strict';
import type { Response } from 'playwright-core';
import { openPage, screenshot, signIn } from './browser.ts';
import { pagesPerTest, useSuite } from './suite.ts';

const suite = useSuite({ prepare: (appliance) => appliance.agreeToTerms() });
const pages = pagesPerTest(suite);

function pathOf(response: Response): string {
  return new URL(response.url()).pathname;
}

test('a first visit loads the page, its icon and its compressed script without a console error or a failed request', async () => {
  // A new context has an empty cache: everything comes from the appliance.
  const context = await suite.browser.newContext();
  try {
    const problems: string[] = [];
    context.on('console', (m) => m.type() === 'error' && problems.push(`console: ${m.text()}`));
    context.on('requestfailed', (r) => problems.push(`failed: ${r.url()} ${r.failure()?.errorText}`));
    context.on('response', (r) => r.status() >= 400 && problems.push(`HTTP ${r.status()}: ${r.url()}`));
    const script = context.waitForEvent('response', (r) => /^\/assets\/.*\.js$/.test(pathOf(r)));

    const page = await openPage(context, suite.appliance.url, suite.watch);
    await page.getByRole('button', { name: 'Sign in' }).waitFor();
    // The page names its icon, on its own origin (the policy's img-src
    // 'self'), so the browser does not ask for a /favicon.ico that is not
    // there. The browser's own icon request is not among the page's
    // requests, so the test asks for the named address itself.
    const link = page.locator('head link[rel~="icon"]');
    assert.equal(await link.count(), 1, 'the page names no icon');
    const named = (await link.getAttribute('href')) ?? '';
    const iconUrl = new URL(named, page.url());
    assert.equal(iconUrl.origin, new URL(suite.appliance.url).origin);
    const icon = await context.request.get(iconUrl.href);
    assert.equal(icon.status(), 200, `${iconUrl.href} answered ${icon.status()}`);
    assert.match(icon.headers()['content-type'] ?? '', /^image\/svg\+xml/);
    assert.match((await icon.text()).trimStart(), /^<svg[\s>]/);

    // The script, most of what a first visit loads, travels compressed, and
    // says that its form depends on what the browser accepts.
    const headers = await (await script).allHeaders();
    assert.equal(headers['content-encoding'], 'gzip', JSON.stringify(headers));
    assert.match(headers['vary'] ?? '', /accept-encoding/i, JSON.stringify(headers));
    assert.match(headers['cache-control'] ?? '', /immutable/, JSON.stringify(headers));

    await signIn(page);
    await page.getByRole('list', { name: 'Installed packages' }).getByRole('link', { name: 'Demo Web', exact: true }).waitFor();
    await page.waitForFunction(() => Array.from(document.images).every((i) => i.complete));
    assert.deepEqual(problems, []);
  } finally {
    await context.close();
  }
});

test('signing out ends on the sign-in screen saying that it is done', async () => {
  const { page } = await pages.signedIn();
  await page.getByRole('button', { name: 'Sign out' }).click();
  await page.getByRole('button', { name: 'Sign in' }).waitFor();
  await page.getByText('Signed out.', { exact: true }).waitFor();
  await screenshot(page, 'signed-out');
  // A later visit starts without it: nothing was signed out then.
  await page.reload();
  await page.getByRole('button', { name: 'Sign in' }).waitFor();
  assert.equal(await page.getByText('Signed out.', { exact: true }).count(), 0);
});
