// "KIVO.Core.Package.Control" and "KIVO.Core.Package.Uninstallation"
// (docs/http-api.md): starting, stopping and removing installed packages.

import type { Api, Result } from './client';

const kControl = 'KIVO.Core.Package.Control';
const kUninstallation = 'KIVO.Core.Package.Uninstallation';

// Sent so that they outlive the page (`keepalive`): an action the user
// asked for reaches the appliance even when the page is reloaded or closed
// right after the click.
const kOutlivesPage = true;

export function controlPackages(api: Api, action: 'start' | 'stop', ids: string[]): Promise<Result<unknown>> {
  return api.call(kControl, action, 1, { id: ids }, kOutlivesPage);
}

// `extraValues`: the answers of the package's uninstall wizard, as one JSON
// text.
export function uninstallPackage(api: Api, id: string, extraValues: string | undefined): Promise<Result<unknown>> {
  return api.call(kUninstallation, 'uninstall', 1, { id, extra_values: extraValues }, kOutlivesPage);
}
