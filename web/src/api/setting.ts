// "KIVO.Core.Package.Setting" and its "Volume" part (docs/settings.md): the
// package center's preferences and the default install volume.

import type { Api, Result } from './client';

const kSetting = 'KIVO.Core.Package.Setting';
const kSettingVolume = 'KIVO.Core.Package.Setting.Volume';

// What "get" answers.
export interface StoredSettings {
  enable_email: boolean;
  enable_nvx: boolean;
  mailset: boolean;
  trust_level: number;
  update_channel: boolean;
  volumes?: { volume_path: string; status: string; size_free_byte?: string }[];
  default_vol?: string;
  volume_status?: string;
  enable_autoupdate: boolean;
  autoupdateall: boolean;
}

export function getSettings(api: Api): Promise<Result<StoredSettings>> {
  return api.call<StoredSettings>(kSetting, 'get', 1);
}

// What "set" takes. The appliance stores them one step after another; a
// failing step names itself in the answer's "failed", and those before it
// stay stored.
export interface SettingsChange {
  update_channel: 'stable' | 'beta';
  trust_level: number;
  enable_nvx: boolean;
  enable_email: boolean;
  enable_autoupdate: boolean;
  autoupdateall: boolean;
  packages: string[];
  default_vol?: string;
}

// The steps of "set" as its answer's "failed" names them, in words.
const kSettingSteps: Record<string, string> = {
  trust_level: 'trust level',
  update_channel: 'update channel',
  notification: 'notifications',
  autoupdate: 'automatic updates',
};

// The step `failed` names in words, or null for a step this page does not
// know.
export function settingStepWords(failed: string): string | null {
  return kSettingSteps[failed] ?? null;
}

export function setSettings(api: Api, change: SettingsChange): Promise<Result<unknown>> {
  return api.call(kSetting, 'set', 1, { ...change });
}

// The default install volume; an appliance with none set answers an empty
// string, not a failure.
export async function getDefaultVolume(api: Api): Promise<Result<string>> {
  const answer = await api.call<{ default_vol?: string } | null>(kSettingVolume, 'get', 1);
  if (!answer.ok) return answer;
  return { ok: true, data: typeof answer.data?.default_vol === 'string' ? answer.data.default_vol : '' };
}
