import type { ComponentChildren } from 'preact';
import { useState } from 'preact/hooks';

// One page of a multi-page flow (an install or uninstall wizard). `problem`
// is what keeps the user from going on, in words; null lets them.
export interface StepPage {
  title: string;
  body: ComponentChildren;
  problem?: string | null;
  nextLabel?: string;
}

// Back / Next through `pages`; the last page's button runs `onFinish`.
// `busy` disables the buttons while the finishing call runs.
export function Steps({
  pages,
  finishLabel,
  onFinish,
  onCancel,
  busy = false,
}: {
  pages: StepPage[];
  finishLabel: string;
  onFinish: () => void;
  onCancel: () => void;
  busy?: boolean;
}) {
  const [index, setIndex] = useState(0);
  const at = Math.min(index, pages.length - 1);
  const page = pages[at];
  const last = at === pages.length - 1;
  return (
    <form
      class="steps"
      onSubmit={(e) => {
        e.preventDefault();
        if (page.problem) return;
        if (last) onFinish();
        else setIndex(at + 1);
      }}
    >
      <p class="step-count">
        Step {at + 1} of {pages.length}: <strong>{page.title}</strong>
      </p>
      <div class="step-body">{page.body}</div>
      {page.problem && (
        <p class="hint" role="status">
          {page.problem}
        </p>
      )}
      <div class="buttons">
        <button type="button" onClick={onCancel} disabled={busy}>
          Cancel
        </button>
        {at > 0 && (
          <button type="button" onClick={() => setIndex(at - 1)} disabled={busy}>
            Back
          </button>
        )}
        <button type="submit" class="primary" disabled={busy || !!page.problem}>
          {last ? finishLabel : (page.nextLabel ?? 'Next')}
        </button>
      </div>
    </form>
  );
}
