// Where tests find the page's screens and a package on them: the catalogue
// opened once the account has agreed to the terms, a package's card in it,
// and a package's row in the installed list.

import type { Locator, Page } from 'playwright-core';
import type { Appliance } from './appliance.ts';

// Opens the catalogue of `appliance` and waits until it lists packages.
// The account must have agreed to the terms already, or the page asks
// first and this waits in vain.
export async function openCatalogue(page: Page, appliance: Appliance): Promise<void> {
  await page.goto(new URL('#/catalogue', appliance.url).href);
  await page
    .getByRole('heading', { name: 'Recommended' })
    .waitFor()
    .catch(async (e: unknown) => {
      throw new Error(`the catalogue lists no packages; ${await shown(page.locator('body'))}`, { cause: e });
    });
}

// What `where` (a dialog, say) shows now, in one line, for the message of a
// wait that failed; the whole page's text when `where` is not on it, since
// a dialog that never opened or closed early is what went wrong then.
export async function shown(where: Locator): Promise<string> {
  const oneLine = (text: string) => `"${text.replace(/\s+/g, ' ').trim()}"`;
  const text = await where.innerText({ timeout: 1_000 }).catch(() => null);
  if (text !== null) return `it shows ${oneLine(text)}`;
  return `it is not shown; the page shows ${oneLine(await where.page().locator('body').innerText())}`;
}

// The catalogue's card of the package displayed as `name`.
export function card(page: Page, name: string): Locator {
  return page.getByRole('listitem', { name, exact: true });
}

// The installed list's row of the package displayed as `name`.
export function row(page: Page, name: string): Locator {
  return page
    .getByRole('list', { name: 'Installed packages' })
    .getByRole('listitem')
    .filter({ has: page.getByRole('link', { name, exact: true }) });
}
