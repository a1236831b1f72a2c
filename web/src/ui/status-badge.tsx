// An installed package's state as the package list reports it (its
// "status"), in words a user understands.

interface StatusText {
  label: string;
  // Why, when the label alone does not say it.
  reason?: string;
  tone: 'running' | 'stopped' | 'broken' | 'busy';
}

const kStatuses: Record<string, StatusText> = {
  running: { label: 'Running', tone: 'running' },
  stop: { label: 'Stopped', tone: 'stopped' },
  starting: { label: 'Starting…', tone: 'busy' },
  stopping: { label: 'Stopping…', tone: 'busy' },
  installing: { label: 'Installing…', tone: 'busy' },
  upgrading: { label: 'Upgrading…', tone: 'busy' },
  uninstalling: { label: 'Uninstalling…', tone: 'busy' },
  broken: { label: 'Broken', reason: 'Its files are damaged or its signature cannot be checked: reinstall it.', tone: 'broken' },
  version_limit: {
    label: 'Stopped',
    reason: 'A package it needs is not at a version it works with.',
    tone: 'broken',
  },
  non_support: { label: 'Not supported', reason: 'It does not run on this appliance.', tone: 'broken' },
  non_installed: { label: 'Not installed', reason: 'The appliance no longer finds it.', tone: 'broken' },
  builtin: { label: 'Built in', reason: 'It is part of the system and cannot be controlled here.', tone: 'stopped' },
  NA: { label: 'Unknown', reason: 'The appliance could not tell whether it runs.', tone: 'broken' },
};

// States in which work runs on the package, so its state will change soon
// without anyone asking for it.
const kBusy = new Set(['starting', 'stopping', 'installing', 'upgrading', 'uninstalling']);

// How often the state of a busy package is asked again.
export const kBusyPollMs = 1500;

export function isBusyStatus(status: string | undefined): boolean {
  return status !== undefined && kBusy.has(status);
}

export function statusText(status: string | undefined): StatusText {
  if (status === undefined) return { label: 'Unknown', reason: 'The appliance did not report its state.', tone: 'broken' };
  return kStatuses[status] ?? { label: 'Unknown', reason: `The appliance reported the state "${status}".`, tone: 'broken' };
}

// The state as a badge, with its reason beside it when there is one.
export function StatusBadge({ status, withReason = false }: { status: string | undefined; withReason?: boolean }) {
  const text = statusText(status);
  return (
    <span class="status">
      <span class={`badge ${text.tone}`}>{text.label}</span>
      {withReason && text.reason && <span class="status-reason"> {text.reason}</span>}
    </span>
  );
}
