// The administrator's explicit switch of a package's origin. Every installed
// package is upgraded only from where it came from (the vendor's server, a
// feed, a file installed by hand) and only by the key that signed it; a
// package from elsewhere replaces it only once the administrator has said
// so here, in words that tell what the switch means
// (docs/package-tool.md, "Origin and signer").

import { useState } from 'preact/hooks';

export function OriginSwitch({
  name,
  installedFrom,
  source,
  busy = false,
  onSwitch,
  onCancel,
}: {
  // The package's name.
  name: string;
  // Where the installed version came from, in words, when known.
  installedFrom?: string;
  // Where the new version comes from, in words ("the feed Community", "a
  // file installed by hand").
  source: string;
  busy?: boolean;
  onSwitch: () => void;
  onCancel: () => void;
}) {
  const [confirmed, setConfirmed] = useState(false);
  return (
    <div class="origin-switch">
      <p class="warning">
        <strong>
          {name} came from {installedFrom ?? 'another source'}, or was signed by another key.
        </strong>{' '}
        It is upgraded only from where it came from, so that no other source can replace it.
      </p>
      <p>
        Installing this version switches its origin: from now on {name} is updated only from {source}, and only versions signed by the key that
        signed this one, or by a publisher in the appliance keyring, are accepted. A key that a feed publishes is trusted only for packages from that
        feed; switching lets it replace {name}. Switch only if you trust {source} with this package.
      </p>
      <label class="choice">
        <input type="checkbox" checked={confirmed} disabled={busy} onChange={(e) => setConfirmed(e.currentTarget.checked)} /> Update {name} from{' '}
        {source} from now on
      </label>
      <div class="buttons">
        <button type="button" onClick={onCancel} disabled={busy}>
          Cancel
        </button>
        <button type="button" class="primary" onClick={onSwitch} disabled={!confirmed || busy}>
          Switch and install
        </button>
      </div>
    </div>
  );
}
