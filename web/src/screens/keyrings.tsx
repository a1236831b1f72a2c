import { useRef, useState } from 'preact/hooks';
import type { ApiFailure } from '../api/client';
import { deleteKey, importKey, listKeys, type SigningKey } from '../api/keyring';
import { useSession } from '../session';
import { ErrorText } from '../ui/error-text';
import { Field, FormButtons, hintId } from '../ui/form';
import { ConfirmDelete, ListingTable, useListing } from '../ui/listing';

// The appliance's code-signing keyring (docs/feeds.md, "The appliance
// keyring"): the keys of the publishers it trusts.

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
  const listing = useListing<SigningKey>(listKeys);
  const { setError, done } = listing;
  const [deleting, setDeleting] = useState<SigningKey | null>(null);

  const remove = async (key: SigningKey) => {
    const result = await deleteKey(api, key);
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
      <ListingTable
        listing={listing}
        caption="Keys of the keyring"
        columns={['Publisher', 'Fingerprint', 'Created', 'State']}
        empty="The keyring holds no key."
        keyOf={(k) => k.fingerprint}
        cells={(k) => (
          <>
            <td>{k.uids.join(', ') || <span class="hint">No name</span>}</td>
            <td class="fingerprint">{grouped(k.fingerprint)}</td>
            <td>{day(k.created)}</td>
            <td>{keyState(k)}</td>
          </>
        )}
        actions={(k) => (
          <button type="button" onClick={() => setDeleting(k)} aria-label={`Delete key ${k.uids[0] ?? k.fingerprint}`}>
            Delete
          </button>
        )}
      />
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
    const result = await importKey(api, file);
    setBusy(false);
    if (!result.ok) return setError(result.error);
    setError(null);
    if (input.current) input.current.value = '';
    await onImported(file.name);
  };
  return (
    <form class="import-key" onSubmit={submit} aria-labelledby="import-key-title">
      <h3 id="import-key-title">Import a public key</h3>
      <Field id="key-file" label="Key file" hint="A publisher's OpenPGP public key (.asc or .gpg). Never import a secret key: it is refused.">
        <input id="key-file" type="file" required ref={input} aria-describedby={hintId('key-file')} />
      </Field>
      <ErrorText error={error} />
      <FormButtons label="Import key" busy={busy} />
    </form>
  );
}
