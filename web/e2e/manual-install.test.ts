// Manual install from a package file: the upload with its progress, the
// package's wizard page answered and the answer arriving in the installed
// package, a licence that must be accepted, the signature warning of an
// unsigned package, refusals of the environment check in words, and an
// abandoned wizard that leaves nothing in the upload area.

import { beforeEach, test } from 'node:test';
import assert from 'node:assert/strict';
import { execFileSync } from 'node:child_process';
import { cpSync, mkdtempSync, readdirSync, readFileSync, rmSync, writeFileSync } from 'node:fs';
import { tmpdir } from 'node:os';
import { join } from 'node:path';
import type { Page } from 'playwright-core';
import { kBuild, kRepo } from './appliance.ts';
import { checkAccessibility, screenshot } from './browser.ts';
import { pagesPerTest, useSuite } from './suite.ts';

const suite = useSuite({ prepare: (appliance) => appliance.agreeToTerms() });
const pages = pagesPerTest(suite);
let page: Page;
const kSamples = '/volume1/public/packages';
const kLicence = 'Demo Licensed may be used for testing only.\nNo warranty of any kind.';

// Each test starts signed in on the manual install screen.
beforeEach(async () => {
  ({ page } = await pages.signedIn());
  await page.getByRole('link', { name: 'Manual install' }).click();
  await page.getByRole('heading', { name: 'Manual install' }).waitFor();
});

function uploadArea(): string[] {
  try {
    return readdirSync(suite.appliance.file('/volume1/@tmp/upload'));
  } catch {
    return [];
  }
}

// `clean` removes the file in the background after answering, so the test
// waits for the upload area to become empty (or fails after a while).
async function waitForEmptyUploadArea(): Promise<void> {
  for (let i = 0; i < 100 && uploadArea().length > 0; ++i) await new Promise((r) => setTimeout(r, 50));
  assert.deepEqual(uploadArea(), []);
}

async function chooseAndUpload(path: string): Promise<void> {
  await page.getByLabel('Package file').setInputFiles(path);
  await page.getByRole('button', { name: 'Upload' }).click();
}

function installed(): string {
  return suite.appliance.kivoctl('list');
}

// A sample with a licence, built and signed at test time with the demo
// publisher's key, which the appliance trusts (no sample carries one).
function buildLicensedPackage(): string {
  const work = mkdtempSync(join(tmpdir(), 'kivo-licensed-'));
  cpSync(join(kRepo, 'examples/packages/demo-future/package'), join(work, 'src/package'), { recursive: true });
  writeFileSync(
    join(work, 'src/INFO'),
    'package="demo-licensed"\nversion="1.0"\ndisplayname="Demo Licensed"\nmaintainer="KIVO Samples"\narch="noarch"\nstartable="no"\n',
  );
  writeFileSync(join(work, 'src/LICENSE'), kLicence);
  const kivoctl = join(kBuild, 'bin/kivoctl');
  const out = join(work, 'demo-licensed.kpk');
  execFileSync(kivoctl, ['build', join(work, 'src'), out]);
  const gnupg = suite.appliance.file('/.samples/gnupg');
  const keys = execFileSync('gpg', ['--homedir', gnupg, '--batch', '--with-colons', '--list-secret-keys'], { encoding: 'utf8' });
  const key = keys.split('\n').find((l) => l.startsWith('fpr'))?.split(':')[9] ?? '';
  execFileSync(kivoctl, ['sign', out, '--homedir', gnupg, '--key', key]);
  return out;
}

test('a package with a wizard page is uploaded with progress, its question answered and the answer reaches the package', async () => {
  // Slow the upload down so its progress is seen on the way.
  const cdp = await page.context().newCDPSession(page);
  await cdp.send('Network.enable');
  await cdp.send('Network.emulateNetworkConditions', { offline: false, latency: 0, downloadThroughput: -1, uploadThroughput: 4096 });
  await chooseAndUpload(suite.appliance.file(`${kSamples}/demo-wizard.kpk`));
  const progress = page.getByRole('progressbar', { name: 'Uploading' });
  await progress.waitFor();
  await page.waitForFunction(() => Number(document.querySelector('progress')?.getAttribute('value') ?? 0) > 0);
  await screenshot(page, 'manual-upload-progress');
  await cdp.send('Network.emulateNetworkConditions', { offline: false, latency: 0, downloadThroughput: -1, uploadThroughput: -1 });

  const dialog = page.getByRole('dialog', { name: 'Install Demo Wizard' });
  await dialog.getByText('Step 1 of 3: Greeting').waitFor();
  const greeting = dialog.getByLabel('Greeting');
  assert.equal(await greeting.inputValue(), 'Hello');
  await greeting.fill('Hi from the browser');
  await screenshot(page, 'manual-wizard-page');
  await checkAccessibility(page, 'manual install wizard page');
  await dialog.getByRole('button', { name: 'Next' }).click();

  // The only volume is preselected.
  await dialog.getByText('Step 2 of 3: Volume').waitFor();
  assert.ok(await dialog.getByRole('radio', { name: /\/volume1/ }).isChecked());
  await screenshot(page, 'manual-volume');
  await dialog.getByRole('button', { name: 'Next' }).click();
  await dialog.getByText('Step 3 of 3: Summary').waitFor();
  await dialog.getByRole('button', { name: 'Install' }).click();

  await dialog.getByText('Demo Wizard 1.0 is installed and running.').waitFor();
  await dialog.getByText('Greeting set to: Hi from the browser').waitFor();
  await screenshot(page, 'manual-installed');
  await dialog.getByRole('button', { name: 'Close' }).click();
  await dialog.waitFor({ state: 'detached' });

  assert.match(installed(), /^demo-wizard 1\.0 /m);
  assert.equal(readFileSync(suite.appliance.file('/var/packages/demo-wizard/var/greeting.txt'), 'utf8'), 'Hi from the browser\n');
  // The install took the uploaded file.
  assert.deepEqual(uploadArea(), []);
});

test('a licence must be accepted before the install goes on', async () => {
  const file = buildLicensedPackage();
  try {
    await chooseAndUpload(file);
    const dialog = page.getByRole('dialog', { name: 'Install Demo Licensed' });
    await dialog.getByText('Step 1 of 3: Licence').waitFor();
    await dialog.getByText('No warranty of any kind.').waitFor();
    const next = dialog.getByRole('button', { name: 'Next' });
    assert.ok(await next.isDisabled());
    await dialog.getByText('Accept the licence to go on.').waitFor();
    await screenshot(page, 'manual-licence');
    await checkAccessibility(page, 'manual install licence');

    await dialog.getByRole('checkbox', { name: 'I accept the licence' }).check();
    await next.click();
    await dialog.getByRole('button', { name: 'Next' }).click();
    await dialog.getByRole('button', { name: 'Install' }).click();
    await dialog.getByText('Demo Licensed 1.0 is installed.').waitFor();
    await dialog.getByRole('button', { name: 'Close' }).click();
    assert.match(installed(), /^demo-licensed 1\.0 /m);
    assert.equal(readFileSync(suite.appliance.file('/var/packages/demo-licensed/LICENSE'), 'utf8'), kLicence);
  } finally {
    rmSync(join(file, '..'), { recursive: true, force: true });
  }
});

// Sets the appliance's trust level (0: trusted publishers only).
function setTrustLevel(level: number): void {
  const info = '/etc/kivoinfo.conf';
  const text = readFileSync(suite.appliance.file(info), 'utf8');
  suite.appliance.replace(info, text.replace(/^pkg_source_trust_level=.*$/m, `pkg_source_trust_level="${level}"`));
}

test('an unverified package is refused in words at "Trusted publishers only", with a way to the setting', async () => {
  await chooseAndUpload(suite.appliance.file(`${kSamples}/demo-unsigned.kpk`));
  const dialog = page.getByRole('dialog', { name: 'Install Demo Unsigned' });
  await dialog.getByText('Step 1 of 3: Signature').waitFor();
  await dialog.getByText(/installs only packages signed by a trusted publisher/).waitFor();
  assert.ok(await dialog.getByRole('button', { name: 'Next' }).isDisabled());
  assert.equal(await dialog.getByRole('checkbox', { name: 'Install it anyway' }).count(), 0);
  await screenshot(page, 'manual-trust-level-refusal');
  await checkAccessibility(page, 'manual install trust level refusal');
  await dialog.getByRole('link', { name: 'Change the trust level in Settings' }).click();
  await page.getByRole('heading', { name: 'Settings', level: 1 }).waitFor();
  await waitForEmptyUploadArea();
  assert.doesNotMatch(installed(), /^demo-unsigned /m);
});

test("at a level that only warns, a stranger's package asks for confirmation, and abandoning its wizard removes the upload", async () => {
  setTrustLevel(1);
  try {
    await confirmAndAbandon();
  } finally {
    setTrustLevel(0);
  }
});

// The community feed's copy of Demo Unsigned, signed by a key that only the
// feed vouches for: uploaded by hand, its signer is a stranger's.
const kStrangers = '/usr/kivo/www/community/demo-unsigned.kpk';

async function confirmAndAbandon(): Promise<void> {
  await chooseAndUpload(suite.appliance.file(kStrangers));
  const dialog = page.getByRole('dialog', { name: 'Install Demo Unsigned' });
  await dialog.getByText('Step 1 of 3: Signature').waitFor();
  await dialog.getByText("This package's signature could not be verified.").waitFor();
  await dialog.getByText(/signed by a key this appliance does not trust/).waitFor();
  assert.ok(await dialog.getByRole('button', { name: 'Next' }).isDisabled());
  await screenshot(page, 'manual-codesign-warning');
  await checkAccessibility(page, 'manual install signature warning');
  assert.equal(uploadArea().length, 1);

  await dialog.getByRole('checkbox', { name: 'Install it anyway' }).check();
  await dialog.getByRole('button', { name: 'Next' }).click();
  await dialog.getByText('Step 2 of 3: Volume').waitFor();
  await dialog.getByRole('button', { name: 'Cancel' }).click();
  await dialog.waitFor({ state: 'detached' });
  await waitForEmptyUploadArea();
  assert.doesNotMatch(installed(), /^demo-unsigned /m);

  // Escape abandons the wizard the same way, and so do leaving the screen
  // and reloading the page.
  await chooseAndUpload(suite.appliance.file(kStrangers));
  await dialog.getByText('Step 1 of 3: Signature').waitFor();
  await page.keyboard.press('Escape');
  await dialog.waitFor({ state: 'detached' });
  await waitForEmptyUploadArea();

  await chooseAndUpload(suite.appliance.file(kStrangers));
  await dialog.getByText('Step 1 of 3: Signature').waitFor();
  await page.evaluate(() => (location.hash = '#/installed'));
  await dialog.waitFor({ state: 'detached' });
  await waitForEmptyUploadArea();
  await page.goBack();

  await chooseAndUpload(suite.appliance.file(kStrangers));
  await dialog.getByText('Step 1 of 3: Signature').waitFor();
  await page.reload();
  await page.getByRole('heading', { name: 'Manual install' }).waitFor();
  await waitForEmptyUploadArea();
}

test('packages the appliance refuses say why in words and leave no upload behind', async () => {
  await chooseAndUpload(suite.appliance.file(`${kSamples}/demo-future.kpk`));
  let dialog = page.getByRole('dialog', { name: 'demo-future.kpk cannot be installed' });
  await dialog.getByText('This package needs a newer system version. Update the appliance first.').waitFor();
  await dialog.getByText('System version it needs: 9.0-0001.').waitFor();
  await screenshot(page, 'manual-refusal');
  await checkAccessibility(page, 'manual install refusal');
  await dialog.getByRole('button', { name: 'Close' }).click();
  await dialog.waitFor({ state: 'detached' });

  await chooseAndUpload(suite.appliance.file(`${kSamples}/demo-legacy.kpk`));
  dialog = page.getByRole('dialog', { name: 'demo-legacy.kpk cannot be installed' });
  await dialog.getByText('Conflicting packages: Demo Notes.').waitFor();
  await dialog.getByRole('button', { name: 'Close' }).click();
  assert.deepEqual(uploadArea(), []);
  assert.doesNotMatch(installed(), /^demo-(future|legacy) /m);

  // Demo Notes runs on the Demo Web that this file would upgrade: that is
  // no refusal of the environment check (the package tool judges at the
  // install whether the new version suits Demo Notes). Leaving the wizard
  // cleans the upload up.
  await chooseAndUpload(suite.appliance.file(`${kSamples}/demo-web-update.kpk`));
  dialog = page.getByRole('dialog', { name: 'Install Demo Web' });
  await dialog.getByText('Install on volume').waitFor();
  await dialog.getByRole('button', { name: 'Cancel' }).click();
  await waitForEmptyUploadArea();
  assert.match(installed(), /^demo-web 1\.0\.0-0001 /m);
});

test('a file replaces a package from the vendor only once the administrator switches its origin', async () => {
  // Demo Web came from the vendor's server. Demo Notes, which runs on it,
  // accepts the new version and runs on.
  try {
    await chooseAndUpload(suite.appliance.file(`${kSamples}/demo-web-update.kpk`));
    const dialog = page.getByRole('dialog', { name: 'Install Demo Web' });
    await dialog.getByText('Step 1 of 2: Volume').waitFor();
    await dialog.getByRole('button', { name: 'Next' }).click();
    await dialog.getByText('Step 2 of 2: Summary').waitFor();
    await dialog.getByText('Installed now').waitFor();
    await dialog.getByRole('button', { name: 'Install' }).click();

    await dialog.getByText('This package came from another source, or was signed by another key.', { exact: false }).waitFor();
    await dialog.getByText('Demo Web came from another source, or was signed by another key.').waitFor();
    await dialog.getByText(/from now on Demo Web is updated only from files installed by hand/).waitFor();
    const switchButton = dialog.getByRole('button', { name: 'Switch and install' });
    assert.ok(await switchButton.isDisabled());
    assert.match(installed(), /^demo-web 1\.0\.0-0001 /m);
    await screenshot(page, 'manual-origin-switch');
    await checkAccessibility(page, 'manual install origin switch');

    await dialog.getByRole('checkbox', { name: 'Update Demo Web from files installed by hand from now on' }).check();
    await switchButton.click();
    await dialog.getByText('Demo Web 1.1.0-0001 is installed and running.').waitFor();
    await dialog.getByRole('button', { name: 'Close' }).click();
    assert.match(installed(), /^demo-web 1\.1\.0-0001 /m);
    assert.match(installed(), /^demo-notes .* running$/m);
    assert.match(readFileSync(suite.appliance.file('/var/packages/demo-web/ORIGIN'), 'utf8'), /^origin="file"$/m);
  } finally {
    if (!/^demo-notes .* running$/m.test(installed())) suite.appliance.kivoctl('start', 'demo-notes');
  }
});
