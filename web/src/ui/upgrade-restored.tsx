// An upgrade that failed and was undone by the package tool (its 305): the
// new version failed a step (preupgrade, postupgrade, its start, its health
// check) and the version before it was put back with its data. The tool's
// answer says which step failed in one line ("The upgrade to 1.1.0 did not
// start within 30 s; 1.0.0 and its data were restored.") followed by the
// last lines of the package's own log; the dialog shows both as the tool
// said them, under a heading that says the upgrade was undone.

// The tool's answer in its parts: the line that says what happened, and the
// package's log lines after it.
export interface RestoreWords {
  what: string | null;
  logLines: string[];
}

// The line of the tool's restore and what follows it. The tool's answer may
// carry the operation log before it; the restore's line is the last one
// that starts "The upgrade to".
export function restoreWords(message: string | undefined): RestoreWords {
  const lines = (message ?? '').split('\n').map((l) => l.trimEnd());
  let at = -1;
  lines.forEach((line, i) => {
    if (line.trimStart().startsWith('The upgrade to ')) at = i;
  });
  if (at < 0) return { what: null, logLines: [] };
  const after = lines.slice(at + 1).filter((l) => l.trim() !== '');
  // "The last lines of demo's log:" introduces the log; the heading below says it.
  const logLines = after.length > 0 && /^The last lines of .*log:$/.test(after[0].trim()) ? after.slice(1) : after;
  return { what: lines[at].trim(), logLines };
}

export function UpgradeRestored({ name, to, from, restore }: { name: string; to: string; from: string | undefined; restore: RestoreWords }) {
  return (
    <div role="alert" class="upgrade-restored">
      <p>
        <strong>
          The upgrade of {name} to {to} did not work and was undone
          {from ? `: ${name} ${from} was put back` : ''}.
        </strong>
      </p>
      {restore.what && <p>{restore.what}</p>}
      {restore.logLines.length > 0 && (
        <>
          <p>The last lines of {name}'s log:</p>
          <pre class="log">{restore.logLines.join('\n')}</pre>
        </>
      )}
    </div>
  );
}
