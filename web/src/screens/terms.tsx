import type { ComponentChildren } from 'preact';

// Not built yet: lets everything through.
export function TermsGate({ children }: { children: ComponentChildren }) {
  return <>{children}</>;
}
