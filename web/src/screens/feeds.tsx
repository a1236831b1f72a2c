import { useState } from 'preact/hooks';
import type { ApiFailure } from '../api/client';
import { addFeed, deleteFeed, listFeeds, renameFeed, type Feed, type FeedAdded } from '../api/feed';
import { useSession } from '../session';
import { Dialog } from '../ui/dialog';
import { ErrorText } from '../ui/error-text';
import { FormButtons, TextField } from '../ui/form';
import { ConfirmDelete, ListingTable, useListing } from '../ui/listing';

// The feeds: package servers added beside the vendor's (docs/feeds.md), each
// with the signing keys it may bring.

export function FeedsSection() {
  const { api } = useSession();
  const listing = useListing<Feed>(listFeeds);
  const { setError, done } = listing;
  const [renaming, setRenaming] = useState<Feed | null>(null);
  const [deleting, setDeleting] = useState<Feed | null>(null);

  // Only the add answer says whether a feed publishes signing keys (the list
  // does not), so the page tells it then.
  // A feed that answers but lists nothing is added too, and said to be empty.
  const added = (feed: Feed, answer: FeedAdded | null) =>
    done(
      (answer?.has_keyrings === true
        ? `Feed “${feed.name || feed.feed}” added. It brings its publishers' signing keys: packages from this feed are checked against them, and against this appliance's keyring.`
        : `Feed “${feed.name || feed.feed}” added. It brings no signing keys: its packages must be signed by a key of this appliance's keyring.`) +
        (answer?.packages === 0 ? ' It answers, but its catalogue lists no packages: nothing from it appears under All packages until it does.' : ''),
    );

  const remove = async (feed: Feed) => {
    const result = await deleteFeed(api, feed);
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
      <ListingTable
        listing={listing}
        caption="Feeds"
        columns={['Name', 'Address']}
        empty="No feed is added."
        keyOf={(f) => f.feed}
        cells={(f) => (
          <>
            <td>{f.name}</td>
            <td class="address">{f.feed}</td>
          </>
        )}
        actions={(f) => (
          <>
            <button type="button" onClick={() => setRenaming(f)} aria-label={`Rename ${f.name}`}>
              Rename
            </button>
            <button type="button" onClick={() => setDeleting(f)} aria-label={`Delete ${f.name}`}>
              Delete
            </button>
          </>
        )}
      />
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

function AddFeedForm({ onAdded }: { onAdded: (feed: Feed, answer: FeedAdded | null) => Promise<void> }) {
  const { api } = useSession();
  const [name, setName] = useState('');
  const [address, setAddress] = useState('');
  const [busy, setBusy] = useState(false);
  const [error, setError] = useState<ApiFailure | null>(null);
  const submit = async (e: Event) => {
    e.preventDefault();
    setBusy(true);
    const feed = { feed: address.trim(), name: name.trim() };
    const result = await addFeed(api, feed);
    setBusy(false);
    if (!result.ok) return setError(result.error);
    setError(null);
    setName('');
    setAddress('');
    await onAdded(feed, result.data);
  };
  return (
    <form class="add-feed" onSubmit={submit} aria-labelledby="add-feed-title">
      <h3 id="add-feed-title">Add a feed</h3>
      <TextField id="feed-name" label="Name" value={name} onValue={setName} hint="Optional: without one, the feed is named after its server." />
      <TextField
        id="feed-address"
        label="Address"
        type="url"
        required
        placeholder="https://example.org/catalogue.json"
        value={address}
        onValue={setAddress}
      />
      <ErrorText error={error} />
      <FormButtons label={busy ? 'Asking the server…' : 'Add feed'} busy={busy} />
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
    const result = await renameFeed(api, feed, name.trim());
    setBusy(false);
    if (!result.ok) return setError(result.error);
    await onRenamed(name.trim() || feed.feed);
  };
  return (
    <Dialog title="Rename feed" onClose={onClose}>
      <form onSubmit={submit}>
        <p class="hint">{feed.feed}</p>
        <TextField id="rename-feed" label="New name" required value={name} onValue={setName} />
        <ErrorText error={error} />
        <FormButtons label="Rename" busy={busy} onCancel={onClose} />
      </form>
    </Dialog>
  );
}
