// A list that one API's "list" method answers as {"items": [...]} (the feeds,
// the keyring), shown as a table with a row of buttons per item, with the
// last change's outcome in words beneath it.

import './listing.css';
import type { ComponentChildren } from 'preact';
import { useEffect, useState } from 'preact/hooks';
import type { Api, ApiFailure, Result } from '../api/client';
import { useSession } from '../session';
import { Dialog } from './dialog';
import { ErrorText } from './error-text';

export interface Listing<T> {
  // null until the first answer.
  items: T[] | null;
  error: ApiFailure | null;
  setError: (error: ApiFailure | null) => void;
  // What the last change that succeeded did, in words.
  notice: string;
  // Reports a change that succeeded, then shows the list as it now stands.
  done: (words: string) => Promise<void>;
}

// The list `list` answers, with the last failure and the last done change.
export function useListing<T>(list: (api: Api) => Promise<Result<{ items: T[] }>>): Listing<T> {
  const { api } = useSession();
  const [items, setItems] = useState<T[] | null>(null);
  const [error, setError] = useState<ApiFailure | null>(null);
  const [notice, setNotice] = useState('');
  const reload = async () => {
    const result = await list(api);
    if (result.ok) setItems(result.data.items);
    else setError(result.error);
  };
  useEffect(() => {
    void reload();
  }, [api]);
  const done = async (words: string) => {
    setError(null);
    setNotice(words);
    await reload();
  };
  return { items, error, setError, notice, done };
}

// The listing as a table: `columns` are the headings, `cells` an item's
// cells under them, `actions` its buttons in a last column. `empty` stands
// in for a list without items.
export function ListingTable<T>({
  listing,
  caption,
  columns,
  empty,
  keyOf,
  cells,
  actions,
}: {
  listing: Listing<T>;
  caption: string;
  columns: string[];
  empty: string;
  keyOf: (item: T) => string;
  cells: (item: T) => ComponentChildren;
  actions: (item: T) => ComponentChildren;
}) {
  const { items, error, notice } = listing;
  return (
    <>
      {items === null && !error && <p class="hint">Loading…</p>}
      {items && items.length === 0 && <p>{empty}</p>}
      {items && items.length > 0 && (
        <table class="listing-table">
          <caption class="visually-hidden">{caption}</caption>
          <TableHead columns={columns} />
          <tbody>
            {items.map((item) => (
              <tr key={keyOf(item)}>
                {cells(item)}
                <td class="row-actions">{actions(item)}</td>
              </tr>
            ))}
          </tbody>
        </table>
      )}
      <Outcome notice={notice} error={error} />
    </>
  );
}

function TableHead({ columns }: { columns: string[] }) {
  return (
    <thead>
      <tr>
        {columns.map((c) => (
          <th scope="col" key={c}>
            {c}
          </th>
        ))}
        <th scope="col">
          <span class="visually-hidden">Actions</span>
        </th>
      </tr>
    </thead>
  );
}

// What the last change did: the success announced politely, a failure as an
// alert.
function Outcome({ notice, error }: { notice: string; error: ApiFailure | null }) {
  return (
    <>
      {notice && !error && (
        <p class="saved" role="status">
          {notice}
        </p>
      )}
      <ErrorText error={error} />
    </>
  );
}

// Asks before something is removed; the safe choice comes first.
export function ConfirmDelete({
  title,
  confirm,
  onConfirm,
  onClose,
  children,
}: {
  title: string;
  confirm: string;
  onConfirm: () => void;
  onClose: () => void;
  children: ComponentChildren;
}) {
  return (
    <Dialog title={title} onClose={onClose}>
      {children}
      <div class="buttons">
        <button type="button" onClick={onClose}>
          Keep it
        </button>
        <button type="button" class="danger" onClick={onConfirm}>
          {confirm}
        </button>
      </div>
    </Dialog>
  );
}
