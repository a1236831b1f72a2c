// Debian's chromium driven by playwright-core, with what every page test
// checks along the way: no Content-Security-Policy violation and no script
// error on any page, an accessibility check per screen, and a screenshot of
// each screen under build/screenshots for a reviewer.

import { mkdirSync, readFileSync } from 'node:fs';
import { createRequire } from 'node:module';
import { join } from 'node:path';
import assert from 'node:assert/strict';
import { chromium, type Browser, type BrowserContext, type Page } from 'playwright-core';
import { kBuild, kPassword } from './appliance.ts';

const kChromium = process.env.KIVO_CHROMIUM ?? '/usr/bin/chromium';
export const kScreenshots = join(kBuild, 'screenshots');
const axeSource = readFileSync(createRequire(import.meta.url).resolve('axe-core/axe.min.js'), 'utf8');

export async function launch(): Promise<Browser> {
  // The sandbox needs user namespaces, which root in a container lacks.
  return chromium.launch({ executablePath: kChromium, args: ['--no-sandbox', '--disable-dev-shm-usage'] });
}

// Problems the page reported: CSP refusals (an inline script or style that
// slipped in) and uncaught errors. Tests assert it stays empty.
export interface Watch {
  problems: string[];
}

export async function openPage(context: BrowserContext, url: string, watch: Watch): Promise<Page> {
  const page = await context.newPage();
  page.on('console', (m) => {
    if (m.type() === 'error' && /Content Security Policy|Refused to/i.test(m.text())) watch.problems.push(m.text());
  });
  page.on('pageerror', (e) => watch.problems.push(`${e.name}: ${e.message}`));
  await page.goto(url);
  return page;
}

// Signs in through the sign-in screen and waits for the main screen.
export async function signIn(page: Page, account = 'admin', password = kPassword): Promise<void> {
  await page.getByLabel('Account').fill(account);
  await page.getByLabel('Password').fill(password);
  await page.getByRole('button', { name: 'Sign in' }).click();
  await page.getByRole('button', { name: 'Sign out' }).waitFor();
}

// A browser context of its own, on `url`, signed in. Every test opens one
// and closes it when done, so a test that fails part way leaves no screen,
// dialog or session behind for the next one: one fault, one failed test.
export async function signedInPage(browser: Browser, url: string, watch: Watch, account = 'admin'): Promise<{ context: BrowserContext; page: Page }> {
  const context = await browser.newContext();
  const page = await openPage(context, url, watch);
  await signIn(page, account);
  return { context, page };
}

export async function screenshot(page: Page, name: string): Promise<void> {
  mkdirSync(kScreenshots, { recursive: true });
  // A full-page shot of a scrolled page would paint the sticky header where
  // the view happened to be.
  await page.evaluate(() => window.scrollTo(0, 0));
  await page.screenshot({ path: join(kScreenshots, `${name}.png`), fullPage: true });
}

interface AxeViolation {
  id: string;
  impact: string | null;
  help: string;
  nodes: { target: string[] }[];
}

// Runs axe-core on the page as it stands and fails on any serious or
// critical violation. axe is evaluated through the browser's debugging
// protocol, which the page's CSP does not govern, so the policy stays on.
export async function checkAccessibility(page: Page, screen: string): Promise<void> {
  await page.evaluate(axeSource);
  const violations = await page.evaluate(async () => {
    const axe = (window as unknown as { axe: { run: (c: Document) => Promise<{ violations: AxeViolation[] }> } }).axe;
    return (await axe.run(document)).violations;
  });
  const serious = violations.filter((v) => v.impact === 'serious' || v.impact === 'critical');
  const described = serious.map((v) => `${v.id} (${v.impact}): ${v.help} at ${v.nodes.map((n) => n.target.join(' ')).join(', ')}`);
  assert.deepEqual(described, [], `accessibility of ${screen}`);
}
