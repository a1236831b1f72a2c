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
  await page.getByRole('heading', { name: 'Recommended' }).waitFor();
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
