import type { ComponentChildren } from 'preact';
import { useEffect, useState } from 'preact/hooks';
import type { ApiFailure } from '../api/client';
import { useSession } from '../session';
import { Dialog } from '../ui/dialog';
import { ErrorText } from '../ui/error-text';

// A list that one API's "list" method answers as {"items": [...]} (the feeds,
// the keyring), with the last failure and the last done change in words.
export function useListing<T>(apiName: string) {
  const { api } = useSession();
  const [items, setItems] = useState<T[] | null>(null);
  const [error, setError] = useState<ApiFailure | null>(null);
  const [notice, setNotice] = useState('');
  const reload = async () => {
    const result = await api.call<{ items: T[] }>(apiName, 'list', 1);
    if (result.ok) setItems(result.data.items);
    else setError(result.error);
  };
  useEffect(() => {
    void reload();
  }, [api]);
  // Reports a change that succeeded, then shows the list as it now stands.
  const done = async (words: string) => {
    setError(null);
    setNotice(words);
    await reload();
  };
  return { items, error, setError, notice, done };
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

// What the last change did: the success announced politely, a failure as an
// alert.
export function Outcome({ notice, error }: { notice: string; error: ApiFailure | null }) {
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

// A table of listed items: `columns` are the headings, and a last column
// holds each row's buttons.
export function ListTable({ caption, columns, children }: { caption: string; columns: string[]; children: ComponentChildren }) {
  return (
    <table class="settings-table">
      <caption class="visually-hidden">{caption}</caption>
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
      <tbody>{children}</tbody>
    </table>
  );
}
