// The settings screen against a real appliance: the terms of service on the
// first visit and again when they change, preferences that come back after a
// reload, the community feed added, renamed and deleted, and a key file
// imported into the keyring and deleted, with bad key files refused in words.

import { test } from 'node:test';
import assert from 'node:assert/strict';
import { execFileSync } from 'node:child_process';
import { mkdtempSync, readFileSync, rmSync, writeFileSync } from 'node:fs';
import { createServer, type Server } from 'node:http';
import type { AddressInfo } from 'node:net';
import { tmpdir } from 'node:os';
import { join } from 'node:path';
import type { Page } from 'playwright-core';
import { kPassword } from './appliance.ts';
import { checkAccessibility, kScreenshots, screenshot } from './browser.ts';
import { pagesPerTest, useSuite } from './suite.ts';

const kCompanyInfo = '/usr/kivo/www/feed/company-info.json';
const kCompanyInfoAddress = 'feed/company-info.json';
const kApp = 'KIVO.PXS.PkgManApp.Instance';

// A publisher's key pair made for this run, exported as the files a user
// might pick: the public key, the secret key, and a file that is no key.
function makeKeyFiles(dir: string): void {
  const home = join(dir, 'gnupg');
  execFileSync('mkdir', ['-m', '700', home]);
  const gpg = (...args: string[]) => execFileSync('gpg', ['--homedir', home, '--batch', '--quiet', ...args]);
  gpg('--passphrase', '', '--quick-gen-key', 'Test Publisher <publisher@example.invalid>', 'ed25519', 'sign', 'never');
  writeFileSync(join(dir, 'publisher.asc'), gpg('--armor', '--export'));
  writeFileSync(join(dir, 'publisher-secret.asc'), gpg('--pinentry-mode', 'loopback', '--passphrase', '', '--armor', '--export-secret-keys'));
  writeFileSync(join(dir, 'garbage.asc'), 'this is not a key\n');
  execFileSync('gpgconf', ['--homedir', home, '--kill', 'gpg-agent']);
}

// The folder of the key files, made before the first test.
let keys = '';

const suite = useSuite({
  prepare: (appliance) => {
    // A package that needs no port of its own, to choose for automatic updates.
    appliance.kivoctl('install', appliance.file('/volume1/public/packages/demo-beta.kpk'));
    keys = mkdtempSync(join(tmpdir(), 'kivo-keys-'));
    makeKeyFiles(keys);
  },
  cleanUp: () => {
    if (keys) rmSync(keys, { recursive: true, force: true });
  },
});
const pages = pagesPerTest(suite);

// A page of the test's own, signed in as an administrator of the test's
// own: the agreement to the terms is per account, so no test (nor a request
// of another test's page still under way) can change what this one finds.
// With `agreed`, the account has agreed to the current terms.
async function signedIn(account: string, agreed: boolean): Promise<Page> {
  suite.appliance.kivoctl('user-add', account, '--password', kPassword, '--group', 'administrators');
  if (agreed) suite.appliance.agreeToTerms(account);
  return (await pages.signedIn(account)).page;
}

// The terms' hash is trusted for up to an hour after it was fetched: make it
// an hour old, as that hour passing would.
function ageTermsHash(account: string): void {
  const settings = JSON.parse(readFileSync(suite.appliance.file(settingsFile(account)), 'utf8'));
  settings[kApp].tos_hash_timestamp = Math.floor(Date.now() / 1000) - 3600;
  suite.appliance.replace(settingsFile(account), JSON.stringify(settings));
}

function settingsFile(account: string): string {
  return `/usr/kivo/etc/users/${account}/settings.json`;
}

function storedAgreement(account: string): Record<string, unknown> {
  return JSON.parse(readFileSync(suite.appliance.file(settingsFile(account)), 'utf8'))[kApp];
}

test('the terms of service are asked on the first visit and again when they change', async () => {
  const page = await signedIn('first-visit', false);
  await page.getByRole('heading', { name: 'Terms of service' }).waitFor();
  await page.getByRole('region', { name: 'Text of the terms of service' }).getByText(/terms/i).first().waitFor();
  await screenshot(page, 'terms');
  await checkAccessibility(page, 'terms');
  await page.getByRole('button', { name: 'I agree' }).click();
  await page.getByRole('heading', { name: 'Terms of service' }).waitFor({ state: 'detached' });
  // The agreement is the appliance's, per account, and in no browser store.
  const agreed = storedAgreement('first-visit');
  assert.equal(agreed.termofservice, true);
  assert.equal(agreed.agreed_tos_hash, agreed.tos_hash);
  const stored = await page.evaluate(() => JSON.stringify({ ...localStorage }) + JSON.stringify({ ...sessionStorage }));
  assert.equal(stored, '{}{}');

  await page.goto(`${suite.appliance.url}#/settings`);
  await page.reload();
  await page.getByRole('heading', { name: 'Settings', level: 1 }).waitFor();
  assert.equal(await page.getByRole('heading', { name: /terms of service/i }).count(), 0);

  // The vendor publishes new terms, and the hour the appliance trusts the
  // hash it fetched has passed.
  const published = readFileSync(suite.appliance.file(kCompanyInfo), 'utf8');
  await suite.appliance.replaceServed(kCompanyInfo, kCompanyInfoAddress, JSON.stringify({ content_hash: 'a'.repeat(64) }));
  try {
    ageTermsHash('first-visit');
    await page.reload();
    await page.getByRole('heading', { name: 'The terms of service have changed' }).waitFor();
    assert.equal(await page.getByRole('heading', { name: 'Settings', level: 1 }).count(), 0);
    await page.getByRole('button', { name: 'I agree' }).click();
    await page.getByRole('heading', { name: 'Settings', level: 1 }).waitFor();
    assert.equal(storedAgreement('first-visit').agreed_tos_hash, 'a'.repeat(64));
  } finally {
    await suite.appliance.replaceServed(kCompanyInfo, kCompanyInfoAddress, published);
  }
});

test('preferences are saved on the appliance and come back after a reload', async () => {
  const page = await signedIn('preferences', true);
  await page.goto(`${suite.appliance.url}#/settings`);
  const preferences = page.getByRole('region', { name: 'Preferences' });
  await preferences.getByRole('radio', { name: 'Stable versions only' }).waitFor();
  assert.ok(await preferences.getByRole('radio', { name: 'Stable versions only' }).isChecked());
  // Mail is not set up on the demo appliance: the mail notice cannot be on.
  assert.ok(await preferences.getByRole('checkbox', { name: 'By mail' }).isDisabled());

  await preferences.getByRole('radio', { name: /Beta versions too/ }).check();
  await preferences.getByRole('radio', { name: /Any publisher/ }).check();
  await preferences.getByRole('radio', { name: 'Update only the packages I choose' }).check();
  await preferences.getByRole('checkbox', { name: /Demo Beta|demo-beta/ }).check();
  await preferences.getByRole('checkbox', { name: 'On the desktop' }).uncheck();
  await preferences.getByLabel('Default volume for new packages').selectOption('/volume1');
  await page.evaluate(() => scrollTo(0, 0));
  await screenshot(page, 'settings');
  await checkAccessibility(page, 'settings');
  await preferences.getByRole('button', { name: 'Save settings' }).click();
  await preferences.getByRole('status').filter({ hasText: 'Settings saved.' }).waitFor();

  await page.reload();
  await preferences.getByRole('radio', { name: /Beta versions too/ }).waitFor();
  assert.ok(await preferences.getByRole('radio', { name: /Beta versions too/ }).isChecked());
  assert.ok(await preferences.getByRole('radio', { name: /Any publisher/ }).isChecked());
  assert.ok(await preferences.getByRole('radio', { name: 'Update only the packages I choose' }).isChecked());
  assert.ok(await preferences.getByRole('checkbox', { name: /Demo Beta|demo-beta/ }).isChecked());
  assert.ok(!(await preferences.getByRole('checkbox', { name: 'On the desktop' }).isChecked()));
  assert.equal(await preferences.getByLabel('Default volume for new packages').inputValue(), '/volume1');

  // And back: every package updated, stable channel, desktop notices on.
  await preferences.getByRole('radio', { name: 'Stable versions only' }).check();
  await preferences.getByRole('radio', { name: /Trusted publishers only/ }).check();
  await preferences.getByRole('radio', { name: 'Update every package automatically' }).check();
  await preferences.getByRole('checkbox', { name: 'On the desktop' }).check();
  await preferences.getByRole('button', { name: 'Save settings' }).click();
  await preferences.getByRole('status').filter({ hasText: 'Settings saved.' }).waitFor();
  await page.reload();
  await preferences.getByRole('radio', { name: 'Update every package automatically' }).waitFor();
  assert.ok(await preferences.getByRole('radio', { name: 'Update every package automatically' }).isChecked());
  assert.ok(await preferences.getByRole('radio', { name: 'Stable versions only' }).isChecked());
  assert.ok(await preferences.getByRole('radio', { name: /Trusted publishers only/ }).isChecked());
  assert.ok(await preferences.getByRole('checkbox', { name: 'On the desktop' }).isChecked());
});

test('the community feed is added with its keys, renamed and deleted; a dead feed is refused', async () => {
  const page = await signedIn('feeds', true);
  await page.goto(`${suite.appliance.url}#/settings`);
  const feeds = page.getByRole('region', { name: 'Feeds' });
  await feeds.getByText('No feed is added.').waitFor();
  const community = `${suite.appliance.url}community/catalogue.json`;

  await feeds.getByLabel('Address', { exact: true }).fill(`${suite.appliance.url}nothing-here/catalogue.json`);
  await feeds.getByRole('button', { name: 'Add feed' }).click();
  await feeds.getByRole('alert').filter({ hasText: /package server|package source/i }).waitFor();

  await feeds.getByLabel('Name', { exact: true }).fill('Community');
  await feeds.getByLabel('Address', { exact: true }).fill(community);
  await feeds.getByRole('button', { name: 'Add feed' }).click();
  await feeds.getByRole('cell', { name: 'Community', exact: true }).waitFor();
  await feeds.getByRole('status').filter({ hasText: /brings its publishers' signing keys/ }).waitFor();
  assert.equal(await feeds.getByRole('alert').count(), 0);
  await feeds.screenshot({ path: join(kScreenshots, 'settings-feeds.png') });

  await feeds.getByRole('button', { name: 'Rename Community' }).click();
  const rename = page.getByRole('dialog', { name: 'Rename feed' });
  await checkAccessibility(page, 'rename feed');
  await rename.getByLabel('New name').fill('Community packages');
  await rename.getByRole('button', { name: 'Rename' }).click();
  await feeds.getByRole('cell', { name: 'Community packages', exact: true }).waitFor();
  await page.reload();
  await feeds.getByRole('cell', { name: 'Community packages', exact: true }).waitFor();
  await feeds.getByRole('cell', { name: community }).waitFor();

  await feeds.getByRole('button', { name: 'Delete Community packages' }).click();
  const confirm = page.getByRole('dialog', { name: 'Delete this feed?' });
  await checkAccessibility(page, 'delete feed');
  await confirm.getByRole('button', { name: 'Delete feed' }).click();
  await feeds.getByText('No feed is added.').waitFor();
  const list = JSON.parse(readFileSync(suite.appliance.file('/usr/kivo/etc/packages/feeds'), 'utf8'));
  assert.deepEqual(list, []);
});

test('a public key file is imported and deleted; a secret key and garbage are refused in words', async () => {
  const page = await signedIn('keys', true);
  await page.goto(`${suite.appliance.url}#/settings`);
  const keyring = page.getByRole('region', { name: 'Code-signing keys' });
  await keyring.getByRole('cell', { name: /^KIVO Demo Publisher/ }).waitFor();

  const importFile = async (name: string) => {
    await keyring.getByLabel('Key file').setInputFiles(join(keys, name));
    await keyring.getByRole('button', { name: 'Import key' }).click();
  };
  await importFile('publisher-secret.asc');
  await keyring.getByRole('alert').filter({ hasText: 'secret key' }).waitFor();
  await importFile('garbage.asc');
  await keyring.getByRole('alert').filter({ hasText: 'no public signing key' }).waitFor();
  await checkAccessibility(page, 'keyring with an error');

  await importFile('publisher.asc');
  await keyring.getByRole('cell', { name: /^Test Publisher/ }).waitFor();
  assert.equal(await keyring.getByRole('alert').count(), 0);
  await keyring.screenshot({ path: join(kScreenshots, 'settings-keyring.png') });
  await page.reload();
  await keyring.getByRole('cell', { name: /^Test Publisher/ }).waitFor();

  await keyring.getByRole('button', { name: /Delete key Test Publisher/ }).click();
  const confirm = page.getByRole('dialog', { name: 'Delete this key?' });
  await checkAccessibility(page, 'delete key');
  await confirm.getByRole('button', { name: 'Delete key' }).click();
  await keyring.getByRole('cell', { name: /^Test Publisher/ }).waitFor({ state: 'detached' });
  await keyring.getByRole('cell', { name: /^KIVO Demo Publisher/ }).waitFor();
});

// The vendor's company-information endpoint as a server that misbehaves on
// request: an answer cut short (the connection closed before the length it
// announced), an error status, or a whole answer naming `hash`.
type VendorAnswer = 'cut short' | 'error' | { hash: string };

function startVendor(answer: () => VendorAnswer): Promise<Server> {
  const server = createServer((_request, response) => {
    const now = answer();
    if (now === 'error') return void response.writeHead(503).end('down');
    const body = now === 'cut short' ? '{"content_hash":"' + 'b'.repeat(64) + '"}' : JSON.stringify({ content_hash: now.hash });
    response.writeHead(200, { 'Content-Type': 'application/json', 'Content-Length': body.length });
    if (now !== 'cut short') return void response.end(body);
    response.write(body.slice(0, 20));
    response.socket?.destroy();
  });
  return new Promise((done) => server.listen(0, '127.0.0.1', () => done(server)));
}

// Clicks "Try again" and waits for the start-up information it asks for.
async function tryAgain(page: Page): Promise<void> {
  const asked = page.waitForResponse((r) => r.request().postData()?.includes('api=KIVO.Core.Package.Info') === true);
  await page.getByRole('button', { name: 'Try again' }).click();
  await asked;
}

test('when the vendor cannot confirm its terms, packages can still be managed, and Try again works once it answers whole', async () => {
  let answer: VendorAnswer = 'cut short';
  const vendor = await startVendor(() => answer);
  const configured = /^company_info_url=(.*)$/m.exec(suite.appliance.kivoctl('server-config'))?.[1] ?? '';
  assert.notEqual(configured, '');
  suite.appliance.kivoctl('server-config', '--company-info', `http://127.0.0.1:${(vendor.address() as AddressInfo).port}/company-info`);
  try {
    // The account agreed before; the hash must now be asked again, and the
    // vendor's answer is cut short.
    const page = await signedIn('unconfirmed', true);
    const unconfirmed = page.getByRole('alert').filter({ hasText: 'could not be confirmed' });
    await unconfirmed.waitFor();
    await page.getByRole('heading', { name: 'The terms of service could not be confirmed' }).waitFor();
    assert.ok(await page.getByRole('button', { name: 'I agree' }).isDisabled());
    await screenshot(page, 'terms-unconfirmed');

    answer = 'error';
    await tryAgain(page);
    await unconfirmed.waitFor();
    assert.ok(await page.getByRole('button', { name: 'I agree' }).isDisabled());
    await page.getByRole('button', { name: 'Continue for now' }).click();
    await page.getByRole('heading', { name: 'Installed packages' }).waitFor();
    await page.reload();
    await unconfirmed.waitFor();

    // The vendor answers whole again, with terms newer than those agreed to.
    answer = { hash: 'c'.repeat(64) };
    await tryAgain(page);
    await page.getByRole('heading', { name: 'The terms of service have changed' }).waitFor();
    assert.equal(await unconfirmed.count(), 0);
    await page.getByRole('button', { name: 'I agree' }).click();
    await page.getByRole('heading', { name: 'Installed packages' }).waitFor();
    assert.equal(storedAgreement('unconfirmed').agreed_tos_hash, 'c'.repeat(64));
  } finally {
    suite.appliance.kivoctl('server-config', '--company-info', configured);
    vendor.closeAllConnections();
    vendor.close();
  }
});
