// The parts every form of the page is made of: a labelled field with its
// hint, a text input bound to a value, and the buttons that end a form.

import type { ComponentChildren, JSX } from 'preact';

// A labelled control on a line of its own. The control (`children`) takes
// `id`, and `hintId(id)` as its aria-describedby when there is a hint.
export function Field({ id, label, hint, children }: { id: string; label: string; hint?: ComponentChildren; children: ComponentChildren }) {
  return (
    <div class="field">
      <label for={id}>{label}</label>
      {children}
      {hint && (
        <span class="hint" id={hintId(id)}>
          {hint}
        </span>
      )}
    </div>
  );
}

export function hintId(id: string): string {
  return `${id}-hint`;
}

type InputProps = Omit<JSX.InputHTMLAttributes<HTMLInputElement>, 'id' | 'value' | 'onInput'>;

// A Field holding a text input that shows `value` and reports each change.
export function TextField({
  id,
  label,
  hint,
  value,
  onValue,
  ...input
}: { id: string; label: string; hint?: ComponentChildren; value: string; onValue: (value: string) => void } & InputProps) {
  return (
    <Field id={id} label={label} hint={hint}>
      <input id={id} value={value} onInput={(e) => onValue(e.currentTarget.value)} aria-describedby={hint ? hintId(id) : undefined} {...input} />
    </Field>
  );
}

// A form's last buttons: Cancel when `onCancel` is given, then the submit
// button, disabled while the form's call runs.
export function FormButtons({ label, busy, onCancel }: { label: string; busy: boolean; onCancel?: () => void }) {
  return (
    <div class="buttons">
      {onCancel && (
        <button type="button" onClick={onCancel}>
          Cancel
        </button>
      )}
      <button type="submit" class="primary" disabled={busy}>
        {label}
      </button>
    </div>
  );
}
