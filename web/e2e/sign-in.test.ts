// Signing in and out, a session that survives a reload without any stored
// secret, and the refusal of an account that is not an administrator.

import { test } from 'node:test';
import assert from 'node:assert/strict';
import { checkAccessibility, screenshot, signIn } from './browser.ts';
import { pagesPerTest, useSuite } from './suite.ts';

// An account that may sign in but is no administrator.
const suite = useSuite({
  prepare: (appliance) => {
    appliance.kivoctl('user-add', 'viewer', '--password', 'viewer-pw', '--group', 'users');
  },
});
const pages = pagesPerTest(suite);

test('an address changed while the signed-in page first appears is followed', async () => {
  const { page } = await pages.signedOut();
  // The moment the header with its tabs enters the document, before the
  // page has painted it, the address moves to the catalogue, as a link
  // followed or a test's goto at that moment does.
  await page.evaluate(() => {
    new MutationObserver((_, observer) => {
      if (!document.querySelector('nav[aria-label="Sections"]')) return;
      observer.disconnect();
      location.hash = '#/catalogue';
    }).observe(document.body, { childList: true, subtree: true });
  });
  await signIn(page);
  await page.getByRole('navigation', { name: 'Sections' }).locator('a[aria-current="page"]', { hasText: 'All packages' }).waitFor();
});

test('an administrator signs in, stays signed in across a reload and signs out', async () => {
  const { context, page } = await pages.signedOut();
  await screenshot(page, 'sign-in');
  await checkAccessibility(page, 'sign-in');

  await page.getByLabel('Account').fill('admin');
  await page.getByLabel('Password').fill('wrong');
  await page.getByRole('button', { name: 'Sign in' }).click();
  await page.getByRole('alert').filter({ hasText: 'Wrong account or password' }).waitFor();

  await signIn(page);
  await page.reload();
  await page.getByRole('button', { name: 'Sign out' }).waitFor();
  // The session id stays in the HttpOnly cookie; no script-readable store
  // holds it or the token.
  const stored = await page.evaluate(() => JSON.stringify({ ...localStorage }) + JSON.stringify({ ...sessionStorage }) + document.cookie);
  const cookie = (await context.cookies()).find((c) => c.name === 'id');
  assert.ok(cookie?.httpOnly);
  assert.ok(!stored.includes(cookie.value));

  await page.getByRole('button', { name: 'Sign out' }).click();
  await page.getByRole('button', { name: 'Sign in' }).waitFor();
  await page.reload();
  await page.getByRole('button', { name: 'Sign in' }).waitFor();
});

test('an account that is not an administrator is told so and can sign out', async () => {
  const { page } = await pages.signedOut();
  await page.getByLabel('Account').fill('viewer');
  await page.getByLabel('Password').fill('viewer-pw');
  await page.getByRole('button', { name: 'Sign in' }).click();
  await page.getByRole('heading', { name: 'Administrators only' }).waitFor();
  await screenshot(page, 'not-administrator');
  await checkAccessibility(page, 'not-administrator');
  // The API refuses the session too, whatever the page shows.
  const answer = await page.evaluate(async () => {
    const r = await fetch('/webapi/entry.cgi', { method: 'POST', body: new URLSearchParams({ api: 'KIVO.Core.Package', version: '1', method: 'list' }) });
    return r.json();
  });
  assert.equal(answer.success, false);
  await page.getByRole('button', { name: 'Sign out' }).click();
  await page.getByRole('button', { name: 'Sign in' }).waitFor();
});
