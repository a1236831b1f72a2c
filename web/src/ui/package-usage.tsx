// What a package uses now: its CPU time and memory, read from its control
// group, beside its limits ("CPU 1.2 s · Memory 14 MiB of 512 MiB"). A
// figure the appliance could not read says "not measured" and why, never 0.
//
// One question serves a whole list: UsageViews asks once, and again whenever
// `refresh` changes (the list it sits in was fetched again); every
// UsageLine and UsageFacts inside it reads its package from that answer.

import './package-usage.css';
import { createContext, type ComponentChildren } from 'preact';
import { useContext, useEffect, useState } from 'preact/hooks';
import { packageUsages, type PackageUsage, type UsageFigure } from '../api/usage';
import { useSession } from '../session';

const Usages = createContext<Map<string, PackageUsage> | null>(null);

export function UsageViews({ refresh, children }: { refresh: unknown; children: ComponentChildren }) {
  const { api } = useSession();
  const [usages, setUsages] = useState<Map<string, PackageUsage> | null>(null);
  useEffect(() => {
    let current = true;
    void packageUsages(api).then((answer) => {
      // Without an answer nothing is shown: no figure is better than a made-up one.
      if (current) setUsages(answer.ok ? answer.data : null);
    });
    return () => {
      current = false;
    };
  }, [api, refresh]);
  return <Usages.Provider value={usages}>{children}</Usages.Provider>;
}

// The usage of `id` from the surrounding UsageViews; undefined before (or
// without) an answer.
export function usePackageUsage(id: string): PackageUsage | undefined {
  return useContext(Usages)?.get(id);
}

export function cpuText(ns: number): string {
  const s = ns / 1e9;
  if (s < 60) return `${s < 10 ? s.toFixed(2) : s.toFixed(1)} s`;
  const m = Math.floor(s / 60);
  return m < 60 ? `${m} min ${Math.round(s - m * 60)} s` : `${Math.floor(m / 60)} h ${m % 60} min`;
}

export function bytesText(n: number): string {
  const mib = n / (1 << 20);
  if (mib < 1) return `${Math.max(1, Math.round(n / 1024))} KiB`;
  return mib < 1024 ? `${mib < 10 ? mib.toFixed(1) : Math.round(mib)} MiB` : `${(mib / 1024).toFixed(1)} GiB`;
}

function figureText(f: UsageFigure, text: (v: number) => string): string {
  return f.measured ? text(f.value) : 'not measured';
}

// The reasons of the figures that were not measured, each once.
function reasons(u: PackageUsage): string[] {
  const all = [u.cpu_ns, u.memory_bytes, u.memory_limit_bytes, u.process_limit].flatMap((f) => (f.measured ? [] : [f.reason]));
  return [...new Set(all)];
}

function memoryText(u: PackageUsage): string {
  const used = figureText(u.memory_bytes, bytesText);
  return u.memory_limit_bytes.measured ? `${used} of ${bytesText(u.memory_limit_bytes.value)}` : used;
}

// One line for the installed list.
export function UsageLine({ id }: { id: string }) {
  const u = useContext(Usages)?.get(id);
  if (!u) return null;
  const why = reasons(u);
  return (
    <span class="usage-line hint" title={why.length > 0 ? `Not measured: ${why.join('; ')}` : undefined}>
      CPU {figureText(u.cpu_ns, cpuText)} · Memory {memoryText(u)}
      {why.length > 0 && <span class="usage-why"> ({why.join('; ')})</span>}
    </span>
  );
}

// The facts for the package's page (inside a <dl>).
export function UsageFacts({ id }: { id: string }) {
  const u = useContext(Usages)?.get(id);
  if (!u) return null;
  const why = reasons(u);
  return (
    <>
      <dt>CPU time</dt>
      <dd class="usage-fact">{figureText(u.cpu_ns, cpuText)}</dd>
      <dt>Memory</dt>
      <dd class="usage-fact">{memoryText(u)}</dd>
      <dt>Process limit</dt>
      <dd class="usage-fact">{u.process_limit.measured ? String(u.process_limit.value) : 'not measured'}</dd>
      {why.length > 0 && (
        <>
          <dt>Not measured</dt>
          <dd class="usage-why">{why.join('; ')}</dd>
        </>
      )}
    </>
  );
}
