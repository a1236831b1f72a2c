// What a package will be allowed to do, shown before the install: a package
// that runs as its own user says so with its limits and signer; one that
// asks to run as root, signed by the appliance's own publisher, must be
// confirmed in words before Install can be pressed; one that asks for root but
// is signed only by a feed's key is refused when its download is checked.

import { test } from 'node:test';
import assert from 'node:assert/strict';
import { cpSync, readFileSync } from 'node:fs';
import { execFileSync } from 'node:child_process';
import { join } from 'node:path';
import { kBuild } from './appliance.ts';
import { screenshot } from './browser.ts';
import { buildSample, callApi, installedState } from './published.ts';
import { card, openCatalogue, shown } from './screens.ts';
import { pagesPerTest, useSuite } from './suite.ts';

const suite = useSuite({ prepare: (appliance) => appliance.agreeToTerms() });
const pages = pagesPerTest(suite);

async function uploadInManualInstall(file: string) {
  const { page } = await pages.signedIn();
  await page.getByRole('link', { name: 'Manual install' }).click();
  await page.getByRole('heading', { name: 'Manual install' }).waitFor();
  await page.getByLabel('Package file').setInputFiles(file);
  await page.getByRole('button', { name: 'Upload' }).click();
  return page;
}

test('a package that runs as its own user shows its user, limits and signer before the install', async () => {
  const file = buildSample(suite.appliance, 'demo-unsigned', { package: 'demo-confined', displayname: 'Demo Confined', memory_limit_mb: '256' });
  const page = await uploadInManualInstall(file);
  const dialog = page.getByRole('dialog', { name: 'Install Demo Confined' });
  await dialog.getByText('Install on volume').waitFor();
  await dialog.getByRole('button', { name: 'Next' }).click();
  // The summary, right above Install, says what the package may do.
  const permissions = dialog.getByRole('region', { name: 'Permissions' });
  const [runsAs, memory, processes, signer, ...more] = await permissions.getByRole('definition').allTextContents();
  assert.deepEqual([runsAs, memory, processes, more], ['a user account of its own, not root', '256 MB', 'appliance default', []]);
  assert.match(signer, /^signed by key [0-9A-F]+, vouched for by appliance keyring$/);
  assert.equal(await dialog.getByText('asks to run with full control').count(), 0);
  await screenshot(page, 'permissions-confined');
  // Nothing to confirm: Install can be pressed.
  assert.equal(await dialog.getByRole('button', { name: 'Install' }).isDisabled(), false);
});

test('a root package signed by the appliance keyring is installed only once the administrator confirms it in words', async () => {
  const file = buildSample(suite.appliance, 'demo-unsigned', { package: 'demo-root', displayname: 'Demo Root', run_as_root: 'yes' });
  const page = await uploadInManualInstall(file);
  const dialog = page.getByRole('dialog', { name: 'Install Demo Root' });
  await dialog.getByText('Install on volume').waitFor();
  await dialog.getByRole('button', { name: 'Next' }).click();
  await dialog.getByText('Demo Root asks to run with full control of the appliance.').waitFor();
  await dialog.getByText('root, with full control of the appliance').waitFor();
  await screenshot(page, 'permissions-root-confirm');
  // Not confirmed: the summary says why, and Install cannot be pressed.
  await dialog.getByText('Confirm that Demo Root may run with full control of the appliance.').waitFor();
  assert.equal(await dialog.getByRole('button', { name: 'Install' }).isDisabled(), true);

  await dialog.getByRole('checkbox', { name: 'I allow Demo Root to run with full control of the appliance' }).check();
  await dialog.getByRole('button', { name: 'Install' }).click();
  await dialog.getByText(/Demo Root 1\.0 is installed/).waitFor({ timeout: 30_000 });
  assert.equal(installedState(suite.appliance, 'demo-root').version, '1.0');
});

// The community feed of the demo appliance offers `file` too, signed by the
// feed's own key (which only its catalogue publishes), indexed as
// `kivoctl index` lists it with the feed's key kept in the catalogue.
async function offerInCommunityFeed(file: string, name: string): Promise<void> {
  const appliance = suite.appliance;
  const community = '/usr/kivo/www/community';
  const gnupg = appliance.file('/community-gnupg');
  const keys = execFileSync('gpg', ['--homedir', gnupg, '--batch', '--with-colons', '--list-secret-keys'], { encoding: 'utf8' });
  const key = keys.split('\n').find((l) => l.startsWith('fpr'))?.split(':')[9] ?? '';
  cpSync(file, appliance.file(`${community}/${name}`));
  execFileSync(join(kBuild, 'bin/kivoctl'), ['sign', appliance.file(`${community}/${name}`), '--homedir', gnupg, '--key', key]);
  const catalogue = appliance.file(`${community}/catalogue.json`);
  const { keyrings } = JSON.parse(readFileSync(catalogue, 'utf8')) as { keyrings: string[] };
  const work = appliance.file('/community-index');
  cpSync(appliance.file(community), work, { recursive: true });
  appliance.kivoctl('index', work, '--base-url', new URL('community', appliance.url).href);
  const indexed = JSON.parse(readFileSync(join(work, 'catalogue.json'), 'utf8')) as { keyrings: string[] };
  indexed.keyrings = keyrings;
  await appliance.replaceServed(`${community}/catalogue.json`, 'community/catalogue.json', JSON.stringify(indexed, null, 2) + '\n');
}

test('a root package signed only by a feed key is refused when its download is checked', async () => {
  const file = buildSample(suite.appliance, 'demo-unsigned', { package: 'demo-root-feed', displayname: 'Demo Root Feed', run_as_root: 'yes' });
  await offerInCommunityFeed(file, 'demo-root-feed.kpk');
  const feed = new URL('community/catalogue.json', suite.appliance.url).href;
  const added = await callApi(suite.appliance, { api: 'KIVO.Core.Package.Feed', version: '1', method: 'add', list: JSON.stringify(JSON.stringify({ feed, name: 'community' })) });
  assert.equal(added.success, true, JSON.stringify(added));

  const { page } = await pages.signedIn();
  await openCatalogue(page, suite.appliance);
  await page.getByRole('button', { name: 'Refresh' }).click();
  const entry = card(page, 'Demo Root Feed');
  await entry.getByText('From the feed community').waitFor();
  await entry.getByRole('button', { name: 'Install Demo Root Feed' }).click();
  const dialog = page.getByRole('dialog', { name: 'Install Demo Root Feed' });
  const refusal = dialog.getByRole('alert');
  await refusal
    .getByText('This package asks to run with full control of the appliance, which only a package signed by a key of the appliance keyring may.', { exact: false })
    .waitFor({ timeout: 90_000 })
    .catch(async () => assert.fail(`no refusal; the dialog: ${await shown(dialog)}`));
  assert.equal(await refusal.getAttribute('data-code'), '4620');
  await refusal.getByText('demo-root-feed asks to run as root', { exact: false }).waitFor();
  await screenshot(page, 'permissions-root-feed-refused');
  await dialog.getByRole('button', { name: 'Close' }).click();
  assert.equal(installedState(suite.appliance, 'demo-root-feed').version, '');
});
