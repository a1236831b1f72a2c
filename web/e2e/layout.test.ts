// The page at a phone's width (390 pixels): every screen fits the window
// with nothing to scroll sideways, the header's tabs and "Sign out"
// included; and long unbroken text (a failure naming a file's address, a
// feed's address, a key's fingerprint) wraps inside its card, at a phone's
// width and a desktop's.

import { afterEach, test } from 'node:test';
import assert from 'node:assert/strict';
import { mkdirSync } from 'node:fs';
import { join } from 'node:path';
import type { BrowserContext, Locator, Page } from 'playwright-core';
import { checkAccessibility, kScreenshots, openPage, screenshot, signIn } from './browser.ts';
import { shown } from './screens.ts';
import { useSuite } from './suite.ts';

const kPhone = { width: 390, height: 844 };
const kDesktop = { width: 1280, height: 800 };

// "newcomer" has not agreed to the terms of service yet, so the terms stand
// in front of the package center; "viewer" is no administrator.
const suite = useSuite({
  prepare: (appliance) => {
    appliance.agreeToTerms();
    appliance.kivoctl('user-add', 'newcomer', '--password', 'newcomer-pw', '--group', 'administrators');
    appliance.kivoctl('user-add', 'viewer', '--password', 'viewer-pw', '--group', 'users');
  },
});

const contexts: BrowserContext[] = [];
afterEach(async () => {
  for (const context of contexts.splice(0)) await context.close();
});

// A page of its own at `viewport` on the sign-in screen, closed after the test.
async function pageAt(viewport: { width: number; height: number }): Promise<Page> {
  const context = await suite.browser.newContext({ viewport });
  contexts.push(context);
  return openPage(context, suite.appliance.url, suite.watch);
}

async function signedInAt(viewport: { width: number; height: number }, account = 'admin', password?: string): Promise<Page> {
  const page = await pageAt(viewport);
  await signIn(page, account, password);
  return page;
}

// Fails when the document is wider than the window, naming the boxes that
// reach past its right edge.
async function expectNoSidewaysScroll(page: Page, screen: string): Promise<void> {
  const measured = await page.evaluate(() => {
    const past = Array.from(document.querySelectorAll('body *'))
      .filter((e) => e.getBoundingClientRect().right > innerWidth + 0.5)
      .slice(0, 8)
      .map((e) => `${e.tagName.toLowerCase()}${e.className ? `.${String(e.className).replace(/ /g, '.')}` : ''}`);
    return { width: document.scrollingElement?.scrollWidth ?? 0, window: innerWidth, past };
  });
  assert.ok(
    measured.width <= measured.window,
    `${screen}: the page is ${measured.width} px wide in a ${measured.window} px window; past its edge: ${measured.past.join(', ')}`,
  );
}

// A screen at the phone's width: it fits, it passes the accessibility
// check, and its screenshot is kept for a look.
async function checkScreen(page: Page, name: string): Promise<void> {
  await expectNoSidewaysScroll(page, name);
  await checkAccessibility(page, name);
  await screenshot(page, name);
}

// A part of a screen (a section far down, a dialog) photographed alone.
async function screenshotOf(part: Locator, name: string): Promise<void> {
  mkdirSync(kScreenshots, { recursive: true });
  await part.screenshot({ path: join(kScreenshots, `${name}.png`) });
}

async function go(page: Page, hash: string): Promise<void> {
  await page.goto(new URL(hash, suite.appliance.url).href);
}

// Fails when the text of `text` reaches past its own box or past `card`.
async function expectTextInside(text: Locator, card: Locator, what: string): Promise<void> {
  const cardBox = await card.boundingBox();
  assert.ok(cardBox, `${what}: the card is not shown`);
  const measured = await text.evaluate((element) => {
    const range = document.createRange();
    range.selectNodeContents(element);
    return { right: range.getBoundingClientRect().right, scrollWidth: element.scrollWidth, clientWidth: element.clientWidth };
  });
  assert.ok(measured.scrollWidth <= measured.clientWidth, `${what}: the text is ${measured.scrollWidth} px wide in a ${measured.clientWidth} px box`);
  const edge = cardBox.x + cardBox.width;
  assert.ok(measured.right <= edge, `${what}: the text ends at ${measured.right} px, past the card's edge at ${edge} px`);
}

// Asks for Demo Gone, whose file the vendor's server has withdrawn, and
// checks that the failure, which names the file's whole address, stays in
// its card.
async function expectGoneFailureInside(page: Page, what: string): Promise<void> {
  await go(page, '#/catalogue');
  const card = page.getByRole('listitem', { name: 'Demo Gone', exact: true });
  await card.getByRole('button', { name: 'Install Demo Gone' }).click();
  const failure = card.getByRole('alert').filter({ hasText: /download of http:\/\/\S+\/feed\/demo-gone\.kpk failed/ });
  await failure.waitFor().catch(async (e: unknown) => {
    throw new Error(`no failure in the card of Demo Gone; the card: ${await shown(card)}`, { cause: e });
  });
  await expectTextInside(failure, card, what);
}

test('the sign-in screen, the terms and the not-an-administrator screen fit a phone', async () => {
  const page = await pageAt(kPhone);
  await page.getByRole('button', { name: 'Sign in' }).waitFor();
  await checkScreen(page, 'phone-sign-in');

  const newcomer = await signedInAt(kPhone, 'newcomer', 'newcomer-pw');
  await newcomer.getByRole('button', { name: 'I agree' }).waitFor();
  await checkScreen(newcomer, 'phone-terms');

  const viewer = await pageAt(kPhone);
  await viewer.getByLabel('Account').fill('viewer');
  await viewer.getByLabel('Password').fill('viewer-pw');
  await viewer.getByRole('button', { name: 'Sign in' }).click();
  await viewer.getByRole('heading', { name: 'Administrators only' }).waitFor();
  await checkScreen(viewer, 'phone-not-administrator');
});

test('every screen of the package center fits a phone, the header with its tabs and Sign out', async () => {
  const page = await signedInAt(kPhone);

  await page.getByRole('list', { name: 'Installed packages' }).getByRole('link', { name: 'Demo Web', exact: true }).waitFor();
  // Every tab and Sign out are on the screen, none of them off to the side.
  const nav = page.getByRole('navigation', { name: 'Sections' });
  for (const control of [...(await nav.getByRole('link').all()), page.getByRole('button', { name: 'Sign out' })]) {
    const box = await control.boundingBox();
    assert.ok(box && box.x >= 0 && box.x + box.width <= kPhone.width, `${await control.textContent()} lies outside the window: ${JSON.stringify(box)}`);
  }
  await checkScreen(page, 'phone-installed');

  await page.getByRole('link', { name: 'Demo Web', exact: true }).click();
  await page.getByRole('heading', { name: 'Demo Web', level: 1 }).waitFor();
  await checkScreen(page, 'phone-package-details');

  await go(page, '#/catalogue');
  await page.getByRole('heading', { name: 'Recommended' }).waitFor();
  await page.waitForFunction(() => Array.from(document.images).every((i) => i.complete));
  await checkScreen(page, 'phone-catalogue');

  await nav.getByRole('link', { name: 'Manual install' }).click();
  await page.getByLabel('Package file').waitFor();
  await checkScreen(page, 'phone-manual-install');
  // The install's pages open in a dialog over the screen.
  await page.getByLabel('Package file').setInputFiles(suite.appliance.file('/volume1/public/packages/demo-wizard.kpk'));
  await page.getByRole('button', { name: 'Upload' }).click();
  const wizard = page.getByRole('dialog', { name: 'Install Demo Wizard' });
  await wizard.getByLabel('Greeting').waitFor();
  await expectNoSidewaysScroll(page, 'manual install wizard');
  await screenshotOf(wizard, 'phone-manual-install-wizard');
  await go(page, '#/settings');

  // Settings, with a feed whose address is one long word and the demo
  // publisher's key in the keyring.
  const feeds = page.getByRole('region', { name: 'Feeds' });
  const address = new URL('community/catalogue.json?channel=stable-and-more', suite.appliance.url).href;
  await feeds.getByLabel('Name', { exact: true }).fill('community');
  await feeds.getByLabel('Address', { exact: true }).fill(address);
  await feeds.getByRole('button', { name: 'Add feed' }).click();
  const row = feeds.getByRole('row', { name: /community/ });
  await row.waitFor();
  const keyring = page.getByRole('region', { name: 'Code-signing keys' });
  await keyring.getByRole('row', { name: /KIVO Demo Publisher/ }).waitFor();
  await page.getByRole('button', { name: 'Save settings' }).waitFor();
  await checkScreen(page, 'phone-settings');
  await expectTextInside(row.getByRole('cell', { name: address }), feeds, 'the feed address');
  await screenshotOf(feeds, 'phone-settings-feeds');
  await screenshotOf(keyring, 'phone-settings-keyring');

  await row.getByRole('button', { name: 'Rename community' }).click();
  const rename = page.getByRole('dialog', { name: 'Rename feed' });
  await rename.getByLabel('New name').waitFor();
  await expectNoSidewaysScroll(page, 'rename feed');
  await expectTextInside(rename.getByText(address), rename, 'the renamed feed address');
  await screenshotOf(rename, 'phone-settings-rename-feed');
  await rename.getByRole('button', { name: 'Cancel' }).click();

  // The activity log, with the feed just added on record.
  await nav.getByRole('link', { name: 'Activity' }).click();
  await page.getByRole('table', { name: 'Activity, newest first' }).getByText('Add a feed').waitFor();
  await checkScreen(page, 'phone-activity');
});

test('a failure naming a long address wraps inside its card, on a desktop and on a phone', async () => {
  await expectGoneFailureInside(await signedInAt(kDesktop), 'Demo Gone at a desktop width');
  const phone = await signedInAt(kPhone);
  await expectGoneFailureInside(phone, 'Demo Gone at a phone width');
  await expectNoSidewaysScroll(phone, 'catalogue with the failure');
  await screenshot(phone, 'phone-catalogue-failure');
});
