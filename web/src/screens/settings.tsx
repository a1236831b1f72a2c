import { useEffect, useState } from 'preact/hooks';
import type { ApiFailure } from '../api/client';
import { listPackages, type PackageInfo } from '../api/package';
import { getSettings, setSettings, settingStepWords, type StoredSettings } from '../api/setting';
import { useSession } from '../session';
import { ErrorText } from '../ui/error-text';
import { Field, FormButtons } from '../ui/form';
import { UpdateWindowSection } from '../ui/update-window';
import { FeedsSection } from './feeds';
import { KeyringsSection } from './keyrings';
import './settings.css';

type InstalledPackage = PackageInfo<{ autoupdate?: boolean }>;

type AutoUpdate = 'off' | 'all' | 'chosen';

// The form's values, in the shape the user edits them.
interface Choices {
  channel: 'stable' | 'beta';
  trustLevel: number;
  autoUpdate: AutoUpdate;
  chosen: string[];
  notifyDesktop: boolean;
  notifyMail: boolean;
  volume: string;
}

const kTrustLevels = [
  { level: 0, label: 'Trusted publishers only', hint: 'Packages signed by a key of this appliance\'s keyring (or of the feed they come from).' },
  { level: 1, label: 'Trusted publishers and unsigned packages', hint: 'Also packages that carry no signature at all.' },
  { level: 2, label: 'Any publisher', hint: 'Any package whose signature, if it has one, is intact, whoever signed it.' },
];

// Why the stored default volume cannot take packages, in words.
const kVolumeProblems: Record<string, string> = {
  no_space: 'The default volume is full.',
  crashed: 'The default volume is damaged.',
  no_found: 'The default volume no longer exists.',
  unknown: 'The default volume cannot be checked.',
};

function choicesOf(stored: StoredSettings, packages: InstalledPackage[]): Choices {
  const autoUpdate: AutoUpdate = !stored.enable_autoupdate ? 'off' : stored.autoupdateall ? 'all' : 'chosen';
  return {
    channel: stored.update_channel ? 'beta' : 'stable',
    trustLevel: stored.trust_level,
    autoUpdate,
    chosen: autoUpdate === 'chosen' ? packages.filter((p) => p.additional?.autoupdate).map((p) => p.id) : [],
    notifyDesktop: stored.enable_nvx,
    notifyMail: stored.enable_email,
    volume: stored.default_vol ?? '',
  };
}

export function SettingsScreen() {
  return (
    <div class="settings">
      <h1>Settings</h1>
      <nav class="settings-sections" aria-label="Settings sections">
        <a href="#preferences">Preferences</a>
        <a href="#update-window">Update window</a>
        <a href="#feeds">Feeds</a>
        <a href="#keyring">Code-signing keys</a>
      </nav>
      <PreferencesSection />
      <UpdateWindowSection />
      <FeedsSection />
      <KeyringsSection />
    </div>
  );
}

function PreferencesSection() {
  const { api } = useSession();
  const [stored, setStored] = useState<StoredSettings | null>(null);
  const [packages, setPackages] = useState<InstalledPackage[]>([]);
  const [choices, setChoices] = useState<Choices | null>(null);
  const [loadError, setLoadError] = useState<ApiFailure | null>(null);
  const [saveError, setSaveError] = useState<{ failure: ApiFailure; step: string } | null>(null);
  const [saved, setSaved] = useState(false);
  const [busy, setBusy] = useState(false);

  const load = async () => {
    const [settings, list] = await Promise.all([getSettings(api), listPackages<{ autoupdate?: boolean }>(api, ['autoupdate'])]);
    if (!settings.ok) return setLoadError(settings.error);
    if (!list.ok) return setLoadError(list.error);
    setLoadError(null);
    setStored(settings.data);
    setPackages(list.data.packages);
    setChoices(choicesOf(settings.data, list.data.packages));
  };
  useEffect(() => {
    void load();
  }, [api]);

  const change = (part: Partial<Choices>) => {
    setSaved(false);
    setChoices((c) => (c ? { ...c, ...part } : c));
  };

  const save = async (e: Event) => {
    e.preventDefault();
    if (!choices) return;
    setBusy(true);
    setSaved(false);
    const result = await setSettings(api, {
      update_channel: choices.channel,
      trust_level: choices.trustLevel,
      enable_nvx: choices.notifyDesktop,
      enable_email: choices.notifyMail,
      enable_autoupdate: choices.autoUpdate !== 'off',
      autoupdateall: choices.autoUpdate === 'all',
      packages: choices.autoUpdate === 'chosen' ? choices.chosen : [],
      default_vol: choices.volume === '' ? undefined : choices.volume,
    });
    setBusy(false);
    if (!result.ok) {
      const step = (result.error.errors?.failed as string | undefined) ?? '';
      setSaveError({ failure: result.error, step });
    } else {
      setSaveError(null);
      setSaved(true);
    }
    // What the appliance stored is what the form shows, also after a failure
    // that left the earlier steps stored.
    await load();
  };

  return (
    <section class="card settings-card" id="preferences" aria-labelledby="preferences-title">
      <h2 id="preferences-title">Preferences</h2>
      {loadError && (
        <div>
          <p>The settings could not be read.</p>
          <ErrorText error={loadError} />
          <button type="button" onClick={() => void load()}>
            Try again
          </button>
        </div>
      )}
      {!choices && !loadError && <p class="hint">Loading…</p>}
      {choices && stored && (
        <form onSubmit={save}>
          <ChannelChoice value={choices.channel} onChange={(channel) => change({ channel })} />
          <TrustChoice value={choices.trustLevel} onChange={(trustLevel) => change({ trustLevel })} />
          <AutoUpdateChoice
            mode={choices.autoUpdate}
            chosen={choices.chosen}
            packages={packages}
            onChange={(autoUpdate, chosen) => change({ autoUpdate, chosen })}
          />
          <NotificationChoice choices={choices} mailSet={stored.mailset} onChange={change} />
          <VolumeChoice stored={stored} value={choices.volume} onChange={(volume) => change({ volume })} />
          {saveError && (
            <div>
              <p>The settings were not all saved{saveError.step ? ` (stopped at: ${settingStepWords(saveError.step) ?? saveError.step})` : ''}.</p>
              <ErrorText error={saveError.failure} />
            </div>
          )}
          {saved && (
            <p class="saved" role="status">
              Settings saved.
            </p>
          )}
          <FormButtons label="Save settings" busy={busy} />
        </form>
      )}
    </section>
  );
}

function ChannelChoice({ value, onChange }: { value: 'stable' | 'beta'; onChange: (v: 'stable' | 'beta') => void }) {
  return (
    <fieldset>
      <legend>Update channel</legend>
      <label class="choice">
        <input type="radio" name="channel" checked={value === 'stable'} onChange={() => onChange('stable')} />
        Stable versions only
      </label>
      <label class="choice">
        <input type="radio" name="channel" checked={value === 'beta'} onChange={() => onChange('beta')} />
        Beta versions too (offered for install and update before their release)
      </label>
    </fieldset>
  );
}

function TrustChoice({ value, onChange }: { value: number; onChange: (v: number) => void }) {
  const known = kTrustLevels.some((t) => t.level === value);
  return (
    <fieldset>
      <legend>Trust level: which publishers' packages may be installed</legend>
      {kTrustLevels.map((t) => (
        <label class="choice" key={t.level}>
          <input type="radio" name="trust" checked={value === t.level} onChange={() => onChange(t.level)} />
          <span>
            {t.label}
            <span class="hint"> — {t.hint}</span>
          </span>
        </label>
      ))}
      {!known && <p class="warning">The stored trust level ({value}) is not one this page knows; choose one.</p>}
    </fieldset>
  );
}

function AutoUpdateChoice({
  mode,
  chosen,
  packages,
  onChange,
}: {
  mode: AutoUpdate;
  chosen: string[];
  packages: InstalledPackage[];
  onChange: (mode: AutoUpdate, chosen: string[]) => void;
}) {
  const toggle = (id: string, on: boolean) => onChange(mode, on ? [...chosen, id] : chosen.filter((c) => c !== id));
  return (
    <fieldset>
      <legend>Automatic updates</legend>
      <label class="choice">
        <input type="radio" name="autoupdate" checked={mode === 'off'} onChange={() => onChange('off', chosen)} />
        Off: I update packages myself
      </label>
      <label class="choice">
        <input type="radio" name="autoupdate" checked={mode === 'all'} onChange={() => onChange('all', chosen)} />
        Update every package automatically
      </label>
      <label class="choice">
        <input type="radio" name="autoupdate" checked={mode === 'chosen'} onChange={() => onChange('chosen', chosen)} />
        Update only the packages I choose
      </label>
      {mode === 'chosen' && (
        <fieldset class="chosen-packages">
          <legend>Packages updated automatically</legend>
          {packages.length === 0 && <p class="hint">No package is installed.</p>}
          {packages.map((p) => (
            <label class="choice" key={p.id}>
              <input type="checkbox" checked={chosen.includes(p.id)} onChange={(e) => toggle(p.id, e.currentTarget.checked)} />
              {p.name || p.id}
            </label>
          ))}
        </fieldset>
      )}
    </fieldset>
  );
}

function NotificationChoice({
  choices,
  mailSet,
  onChange,
}: {
  choices: Choices;
  mailSet: boolean;
  onChange: (part: Partial<Choices>) => void;
}) {
  return (
    <fieldset>
      <legend>Notifications of package updates</legend>
      <label class="choice">
        <input type="checkbox" checked={choices.notifyDesktop} onChange={(e) => onChange({ notifyDesktop: e.currentTarget.checked })} />
        On the desktop
      </label>
      <label class="choice">
        <input
          type="checkbox"
          checked={choices.notifyMail && mailSet}
          disabled={!mailSet}
          aria-describedby={mailSet ? undefined : 'mail-hint'}
          onChange={(e) => onChange({ notifyMail: e.currentTarget.checked })}
        />
        By mail
      </label>
      {!mailSet && (
        <p class="hint" id="mail-hint">
          Mail is not set up on this appliance, so no mail can be sent.
        </p>
      )}
    </fieldset>
  );
}

function VolumeChoice({ stored, value, onChange }: { stored: StoredSettings; value: string; onChange: (v: string) => void }) {
  const volumes = stored.volumes ?? [];
  return (
    <Field id="default-volume" label="Default volume for new packages">
      <select id="default-volume" value={value} onChange={(e) => onChange(e.currentTarget.value)}>
        {value === '' && <option value="">Not chosen: ask at each install</option>}
        {value !== '' && !volumes.some((v) => v.volume_path === value) && <option value={value}>{value} (not available)</option>}
        {volumes.map((v) => (
          <option key={v.volume_path} value={v.volume_path}>
            {v.volume_path}
            {v.status !== 'normal' ? ` (${v.status})` : ''}
          </option>
        ))}
      </select>
      {stored.volume_status && <p class="warning">{kVolumeProblems[stored.volume_status] ?? kVolumeProblems.unknown}</p>}
    </Field>
  );
}
