// What every browser test file sets up around its tests: one appliance and
// one browser for the file's tests, the check after the last test that no
// page reported a CSP refusal or a script error, and browser contexts that
// each test opens and that are closed after it.

import { after, afterEach, before } from 'node:test';
import assert from 'node:assert/strict';
import type { Browser, BrowserContext, Page } from 'playwright-core';
import { Appliance } from './appliance.ts';
import { launch, openPage, signedInPage, type Watch } from './browser.ts';

export interface Suite {
  readonly appliance: Appliance;
  readonly browser: Browser;
  readonly watch: Watch;
}

// Starts the appliance and the browser before the file's first test and
// stops them after its last. `prepare` readies the appliance before the
// browser starts (an agreement to the terms, a package, a feed); `cleanUp`
// runs once the browser is closed, before the appliance stops.
export function useSuite({
  prepare,
  cleanUp,
}: { prepare?: (appliance: Appliance) => void | Promise<void>; cleanUp?: () => void | Promise<void> } = {}): Suite {
  const suite = { watch: { problems: [] } } as unknown as { appliance: Appliance; browser: Browser; watch: Watch };
  before(async () => {
    suite.appliance = await Appliance.start();
    await prepare?.(suite.appliance);
    suite.browser = await launch();
  });
  after(async () => {
    await suite.browser?.close();
    await cleanUp?.();
    await suite.appliance?.stop();
    assert.deepEqual(suite.watch.problems, []);
  });
  return suite;
}

export interface Opened {
  context: BrowserContext;
  page: Page;
}

// Browser contexts of a test's own on the appliance's page. Each is closed
// after the test that opened it, whether it passed or not, so a test that
// fails part way leaves no screen, dialog or session behind for the next
// one: one fault, one failed test.
export interface Pages {
  // Signed in as `account` (an administrator the appliance knows).
  signedIn(account?: string): Promise<Opened>;
  // On the sign-in screen.
  signedOut(): Promise<Opened>;
}

export function pagesPerTest(suite: Suite): Pages {
  const open: BrowserContext[] = [];
  afterEach(async () => {
    for (const context of open.splice(0)) await context.close();
  });
  const kept = (opened: Opened) => {
    open.push(opened.context);
    return opened;
  };
  return {
    signedIn: async (account = 'admin') => kept(await signedInPage(suite.browser, suite.appliance.url, suite.watch, account)),
    signedOut: async () => {
      const context = await suite.browser.newContext();
      open.push(context);
      return { context, page: await openPage(context, suite.appliance.url, suite.watch) };
    },
  };
}
