import { useState } from 'preact/hooks';
import type { ApiFailure } from '../api/client';
import { useSession } from '../session';
import { Dialog } from '../ui/dialog';
import { ErrorText } from '../ui/error-text';
import { ConfirmDelete, ListTable, Outcome, useListing } from './settings-list';

// A feed: a package server added beside the vendor's ("KIVO.Core.Package.Feed",
// docs/feeds.md). The address is the feed's key.
interface Feed {
  feed: string;
  name: string;
}

// The Feed methods take their argument as one JSON text in `list`.
const feedApi = 'KIVO.Core.Package.Feed';

export function FeedsSection() {
  const { api } = useSession();
  const { items: feeds, error, setError, notice, done } = useListing<Feed>(feedApi);
  const [renaming, setRenaming] = useState<Feed | null>(null);
  const [deleting, setDeleting] = useState<Feed | null>(null);

  // Only the add answer says whether a feed publishes signing keys (the list
  // does not), so the page tells it then.
  const added = (feed: Feed, hasKeys: boolean) =>
    done(
      hasKeys
        ? `Feed “${feed.name || feed.feed}” added. It brings its publishers' signing keys: packages from this feed are checked against them, and against this appliance's keyring.`
        : `Feed “${feed.name || feed.feed}” added. It brings no signing keys: its packages must be signed by a key of this appliance's keyring.`,
    );

  const remove = async (feed: Feed) => {
    const result = await api.call(feedApi, 'delete', 1, { list: JSON.stringify([feed.feed]) });
    setDeleting(null);
    if (!result.ok) return setError(result.error);
    await done(`Feed “${feed.name}” deleted, with the signing keys it brought.`);
  };

  return (
    <section class="card settings-card" id="feeds" aria-labelledby="feeds-title">
      <h2 id="feeds-title">Feeds</h2>
      <p class="hint">
        Package servers besides the vendor's. Their packages appear under All packages. A feed may publish its publishers'
        signing keys; they vouch for that feed's packages only.
      </p>
      {feeds === null && !error && <p class="hint">Loading…</p>}
      {feeds && feeds.length === 0 && <p>No feed is added.</p>}
      {feeds && feeds.length > 0 && (
        <ListTable caption="Feeds" columns={['Name', 'Address']}>
          {feeds.map((f) => (
            <tr key={f.feed}>
              <td>{f.name}</td>
              <td class="address">{f.feed}</td>
              <td class="row-actions">
                <button type="button" onClick={() => setRenaming(f)} aria-label={`Rename ${f.name}`}>
                  Rename
                </button>
                <button type="button" onClick={() => setDeleting(f)} aria-label={`Delete ${f.name}`}>
                  Delete
                </button>
              </td>
            </tr>
          ))}
        </ListTable>
      )}
      <Outcome notice={notice} error={error} />
      <AddFeedForm onAdded={added} />
      {renaming && (
        <RenameFeedDialog
          feed={renaming}
          onClose={() => setRenaming(null)}
          onRenamed={async (name) => {
            setRenaming(null);
            await done(`Feed renamed to “${name}”.`);
          }}
        />
      )}
      {deleting && (
        <ConfirmDelete title="Delete this feed?" confirm="Delete feed" onConfirm={() => void remove(deleting)} onClose={() => setDeleting(null)}>
          <p>
            “{deleting.name}” ({deleting.feed}) and the signing keys it brought will be removed. Packages installed from it stay
            installed, but their signer is then only trusted if this appliance's keyring knows it.
          </p>
        </ConfirmDelete>
      )}
    </section>
  );
}

function AddFeedForm({ onAdded }: { onAdded: (feed: Feed, hasKeys: boolean) => Promise<void> }) {
  const { api } = useSession();
  const [name, setName] = useState('');
  const [address, setAddress] = useState('');
  const [busy, setBusy] = useState(false);
  const [error, setError] = useState<ApiFailure | null>(null);
  const submit = async (e: Event) => {
    e.preventDefault();
    setBusy(true);
    const feed = { feed: address.trim(), name: name.trim() };
    // The appliance asks the server before it stores the feed, which may
    // take up to its catalogue time-out.
    const result = await api.call<{ has_keyrings?: boolean } | null>(feedApi, 'add', 1, { list: JSON.stringify(feed) });
    setBusy(false);
    if (!result.ok) return setError(result.error);
    setError(null);
    setName('');
    setAddress('');
    await onAdded(feed, result.data?.has_keyrings === true);
  };
  return (
    <form class="add-feed" onSubmit={submit} aria-labelledby="add-feed-title">
      <h3 id="add-feed-title">Add a feed</h3>
      <div class="field">
        <label for="feed-name">Name</label>
        <input id="feed-name" value={name} onInput={(e) => setName(e.currentTarget.value)} aria-describedby="feed-name-hint" />
        <span class="hint" id="feed-name-hint">
          Optional: without one, the feed is named after its server.
        </span>
      </div>
      <div class="field">
        <label for="feed-address">Address</label>
        <input
          id="feed-address"
          type="url"
          required
          placeholder="https://example.org/catalogue.json"
          value={address}
          onInput={(e) => setAddress(e.currentTarget.value)}
        />
      </div>
      <ErrorText error={error} />
      <div class="buttons">
        <button type="submit" class="primary" disabled={busy}>
          {busy ? 'Asking the server…' : 'Add feed'}
        </button>
      </div>
    </form>
  );
}

function RenameFeedDialog({ feed, onClose, onRenamed }: { feed: Feed; onClose: () => void; onRenamed: (name: string) => Promise<void> }) {
  const { api } = useSession();
  const [name, setName] = useState(feed.name);
  const [busy, setBusy] = useState(false);
  const [error, setError] = useState<ApiFailure | null>(null);
  const submit = async (e: Event) => {
    e.preventDefault();
    setBusy(true);
    // "set" changes name and address together; the address stays.
    const result = await api.call(feedApi, 'set', 1, { list: JSON.stringify({ orifeed: feed.feed, feed: feed.feed, name: name.trim() }) });
    setBusy(false);
    if (!result.ok) return setError(result.error);
    await onRenamed(name.trim() || feed.feed);
  };
  return (
    <Dialog title="Rename feed" onClose={onClose}>
      <form onSubmit={submit}>
        <p class="hint">{feed.feed}</p>
        <div class="field">
          <label for="rename-feed">New name</label>
          <input id="rename-feed" required value={name} onInput={(e) => setName(e.currentTarget.value)} />
        </div>
        <ErrorText error={error} />
        <div class="buttons">
          <button type="button" onClick={onClose}>
            Cancel
          </button>
          <button type="submit" class="primary" disabled={busy}>
            Rename
          </button>
        </div>
      </form>
    </Dialog>
  );
}
