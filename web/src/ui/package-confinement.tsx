// How a package is confined, from its confinement record as the Usage API
// carries it (docs/package-tool.md, "What was applied"): a short badge for
// the installed list and the full words for the package's page. Nothing
// here claims what the record does not say: a package without a record is
// "not confined yet", a state this page does not know is "not known".
//
// Both read the package from the surrounding UsageViews (ui/package-usage.tsx)
// and show nothing until it has answered.

import './package-confinement.css';
import type { Confinement } from '../api/usage';
import { usePackageUsage } from './package-usage';

// What each item of the record is, in words.
const kWhat: Record<string, string> = {
  user: 'its own user',
  no_new_privs: 'the no-new-privileges flag',
  landlock_filesystem: 'the file access rules',
  landlock_scope_signal: 'the signal scope',
  landlock_scope_abstract_unix_socket: 'the socket scope',
  temp_folder: 'its temporary folder',
  cgroup_memory: 'the memory limit',
  cgroup_pids: 'the process limit',
  cgroup_cpu: 'the CPU time measurement',
  cgroup: 'its control groups',
};

function whatText(what: string): string {
  return kWhat[what] ?? what;
}

function listText(items: string[]): string {
  return items.length < 2 ? items.join('') : `${items.slice(0, -1).join(', ')} and ${items[items.length - 1]}`;
}

// "<what> was not applied because <reason>", one sentence per reason.
export function missingSentences(c: Confinement): string[] {
  const byReason = new Map<string, string[]>();
  for (const m of c.missing) byReason.set(m.reason, [...(byReason.get(m.reason) ?? []), whatText(m.what)]);
  return [...byReason].map(([reason, whats]) => `${listText(whats)} ${whats.length > 1 ? 'were' : 'was'} not applied because ${reason}`);
}

export interface ConfinementWords {
  kind: 'confined' | 'partly' | 'root' | 'none' | 'unknown';
  badge: string;
  text: string;
}

export function confinementWords(c: Confinement | null): ConfinementWords {
  if (c === null || c.state === 'no_account') {
    return { kind: 'none', badge: 'Not confined yet', text: 'Not confined yet: it gets its account at its next start' };
  }
  switch (c.state) {
    case 'confined':
      return { kind: 'confined', badge: 'Confined', text: 'Runs as its own user, confined' };
    case 'root':
      return { kind: 'root', badge: 'Root', text: 'Runs as root, unconfined (it asks to)' };
    case 'turned_off':
      return {
        kind: 'root',
        badge: 'Root',
        text: 'Runs as root, unconfined: confinement is turned off in the package tool\'s settings',
      };
    case 'partly':
      return { kind: 'partly', badge: 'Partly confined', text: `Partly confined: ${missingSentences(c).join('; ')}` };
    default:
      return { kind: 'unknown', badge: 'Confinement not known', text: 'Its confinement is not known to this page' };
  }
}

// The badge in the installed list; its title has the full words.
export function ConfinementBadge({ id }: { id: string }) {
  const u = usePackageUsage(id);
  if (!u) return null;
  const words = confinementWords(u.confinement);
  return (
    <span class={`badge confinement ${words.kind}`} title={words.text}>
      {words.badge}
    </span>
  );
}

// The facts for the package's page (inside a <dl>).
export function ConfinementFacts({ id }: { id: string }) {
  const u = usePackageUsage(id);
  if (!u) return null;
  const c = u.confinement;
  const words = confinementWords(c);
  return (
    <>
      <dt>Confinement</dt>
      <dd class={`confinement-fact ${words.kind}`}>{words.text}</dd>
      {c !== null && (
        <>
          <dt>Runs as</dt>
          <dd class="confinement-user">
            {c.user} (uid {c.uid})
          </dd>
        </>
      )}
    </>
  );
}
