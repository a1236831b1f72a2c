// The terms of service (docs/settings.md): whether the user must agree,
// from "KIVO.Core.Package.Info", and the agreement, stored through
// "KIVO.API.UserSettings" in the user's settings on the appliance.

import type { Api, Result } from './client';

// What "Info" "get" says about the terms: "new" until the user agreed,
// "change" when the text changed since (or its hash cannot be confirmed),
// "no" otherwise.
export interface PackageCenterInfo {
  show_tos: 'no' | 'new' | 'change';
  tos_hash: string;
}

// The package center's own object in the user's settings on the appliance,
// the same one the information reads the agreement from. The agreement lives
// there, per account, never in the browser.
const kPackageCenterSettings = 'KIVO.PXS.PkgManApp.Instance';

export function readPackageCenterInfo(api: Api): Promise<Result<PackageCenterInfo>> {
  return api.call<PackageCenterInfo>('KIVO.Core.Package.Info', 'get', 1);
}

// Records that the user agreed to the terms whose hash is `hash`.
export function agreeToTerms(api: Api, hash: string): Promise<Result<unknown>> {
  return api.call('KIVO.API.UserSettings', 'set', 1, {
    app: kPackageCenterSettings,
    settings: { termofservice: true, termofservice_4_2: true, agreed_tos_hash: hash },
  });
}
