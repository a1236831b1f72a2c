// Signing in and out, a session that survives a reload without any stored
// secret, and the refusal of an account that is not an administrator.

import { after, before, test } from 'node:test';
import assert from 'node:assert/strict';
import type { Browser } from 'playwright-core';
import { Appliance } from './appliance.ts';
import { checkAccessibility, launch, openPage, screenshot, signIn, type Watch } from './browser.ts';

let appliance: Appliance;
let browser: Browser;
const watch: Watch = { problems: [] };

before(async () => {
  appliance = await Appliance.start();
  appliance.kivoctl('user-add', 'viewer', '--password', 'viewer-pw', '--group', 'users');
  browser = await launch();
});

after(async () => {
  await browser?.close();
  await appliance?.stop();
  assert.deepEqual(watch.problems, []);
});

test('an administrator signs in, stays signed in across a reload and signs out', async () => {
  const context = await browser.newContext();
  const page = await openPage(context, appliance.url, watch);
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
  await context.close();
});

test('an account that is not an administrator is told so and can sign out', async () => {
  const context = await browser.newContext();
  const page = await openPage(context, appliance.url, watch);
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
  await context.close();
});
