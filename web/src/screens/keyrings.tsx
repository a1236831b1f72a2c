import { useRef, useState } from 'preact/hooks';
import type { ApiFailure } from '../api/client';
import { useSession } from '../session';
import { ErrorText } from '../ui/error-text';
import { ConfirmDelete, ListTable, Outcome, useListing } from './settings-list';

// A key of the appliance's code-signing keyring, as the listing gives it
// (docs/feeds.md, "The appliance keyring").
interface SigningKey {
  fingerprint: string;
  uids: string[];
  created: number;
  expires: number | null;
  revoked: boolean;
}

const keyringApi = 'KIVO.Core.Package.Feed.Keyring';

// Fingerprints read more easily, and are compared by eye more reliably, in
// groups of four.
function grouped(fingerprint: string): string {
  return fingerprint.replace(/(.{4})(?=.)/g, '$1 ');
}

function day(seconds: number): string {
  return new Date(seconds * 1000).toISOString().slice(0, 10);
}

function keyState(key: SigningKey): string {
  if (key.revoked) return 'Revoked';
  if (key.expires !== null && key.expires * 1000 < Date.now()) return `Expired ${day(key.expires)}`;
  return key.expires === null ? 'Valid, never expires' : `Valid until ${day(key.expires)}`;
}

export function KeyringsSection() {
  const { api } = useSession();
  const { items: keys, error, setError, notice, done } = useListing<SigningKey>(keyringApi);
  const [deleting, setDeleting] = useState<SigningKey | null>(null);

  const remove = async (key: SigningKey) => {
    const result = await api.call(keyringApi, 'delete', 1, { list: JSON.stringify([key.fingerprint]) });
    setDeleting(null);
    if (!result.ok) return setError(result.error);
    await done(`Key ${grouped(key.fingerprint)} deleted.`);
  };

  return (
    <section class="card settings-card" id="keyring" aria-labelledby="keyring-title">
      <h2 id="keyring-title">Code-signing keys</h2>
      <p class="hint">
        The keys of publishers this appliance trusts. At the strictest trust level only packages signed by one of these keys (or
        by a key their feed brings) can be installed.
      </p>
      {keys === null && !error && <p class="hint">Loading…</p>}
      {keys && keys.length === 0 && <p>The keyring holds no key.</p>}
      {keys && keys.length > 0 && (
        <ListTable caption="Keys of the keyring" columns={['Publisher', 'Fingerprint', 'Created', 'State']}>
          {keys.map((k) => (
            <tr key={k.fingerprint}>
              <td>{k.uids.join(', ') || <span class="hint">No name</span>}</td>
              <td class="fingerprint">{grouped(k.fingerprint)}</td>
              <td>{day(k.created)}</td>
              <td>{keyState(k)}</td>
              <td class="row-actions">
                <button type="button" onClick={() => setDeleting(k)} aria-label={`Delete key ${k.uids[0] ?? k.fingerprint}`}>
                  Delete
                </button>
              </td>
            </tr>
          ))}
        </ListTable>
      )}
      <Outcome notice={notice} error={error} />
      <ImportKeyForm onImported={(name) => done(`Key file “${name}” imported.`)} />
      {deleting && (
        <ConfirmDelete title="Delete this key?" confirm="Delete key" onConfirm={() => void remove(deleting)} onClose={() => setDeleting(null)}>
          <p>
            {deleting.uids.join(', ')} ({grouped(deleting.fingerprint)}). Packages signed only by this key can no longer be
            installed at the strictest trust level.
          </p>
        </ConfirmDelete>
      )}
    </section>
  );
}

function ImportKeyForm({ onImported }: { onImported: (name: string) => Promise<void> }) {
  const { api } = useSession();
  const input = useRef<HTMLInputElement>(null);
  const [busy, setBusy] = useState(false);
  const [error, setError] = useState<ApiFailure | null>(null);
  const submit = async (e: Event) => {
    e.preventDefault();
    const file = input.current?.files?.[0];
    if (!file) return;
    setBusy(true);
    // Key files are small: no progress bar is worth showing.
    const result = await api.upload(keyringApi, 'add', 1, {}, file, () => {}, undefined, 'upload_keyring');
    setBusy(false);
    if (!result.ok) return setError(result.error);
    setError(null);
    if (input.current) input.current.value = '';
    await onImported(file.name);
  };
  return (
    <form class="import-key" onSubmit={submit} aria-labelledby="import-key-title">
      <h3 id="import-key-title">Import a public key</h3>
      <div class="field">
        <label for="key-file">Key file</label>
        <input id="key-file" type="file" required ref={input} aria-describedby="key-file-hint" />
        <span class="hint" id="key-file-hint">
          A publisher's OpenPGP public key (.asc or .gpg). Never import a secret key: it is refused.
        </span>
      </div>
      <ErrorText error={error} />
      <div class="buttons">
        <button type="submit" class="primary" disabled={busy}>
          Import key
        </button>
      </div>
    </form>
  );
}
