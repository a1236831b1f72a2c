// "KIVO.Core.Package.Feed.Keyring" (docs/feeds.md, "The appliance keyring"):
// the keys of the publishers this appliance trusts.

import type { Api, Result } from './client';

const kKeyring = 'KIVO.Core.Package.Feed.Keyring';

export interface SigningKey {
  fingerprint: string;
  uids: string[];
  created: number;
  expires: number | null;
  revoked: boolean;
}

export function listKeys(api: Api): Promise<Result<{ items: SigningKey[] }>> {
  return api.call<{ items: SigningKey[] }>(kKeyring, 'list', 1);
}

// Key files are small: the upload reports no progress.
export function importKey(api: Api, file: File): Promise<Result<unknown>> {
  return api.upload(kKeyring, 'add', 1, {}, file, () => {}, undefined, 'upload_keyring');
}

export function deleteKey(api: Api, key: SigningKey): Promise<Result<unknown>> {
  return api.call(kKeyring, 'delete', 1, { list: JSON.stringify([key.fingerprint]) });
}
