// A labelled progress bar; `value` is 0..1, or null while the total is not
// known yet.
export function ProgressBar({ label, value }: { label: string; value: number | null }) {
  const percent = value === null ? undefined : Math.round(Math.min(1, Math.max(0, value)) * 100);
  return (
    <div class="progress">
      <progress aria-label={label} max={100} value={percent} />
      <span class="progress-text">{percent === undefined ? label : `${label}: ${percent}%`}</span>
    </div>
  );
}
