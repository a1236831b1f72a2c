import { createContext } from 'preact';
import { useContext } from 'preact/hooks';
import type { Api } from './api/client';

// What every screen needs: the API client of the signed-in session and who
// is signed in.
export interface SessionContext {
  api: Api;
  account: string;
}

export const Session = createContext<SessionContext | null>(null);

export function useSession(): SessionContext {
  const session = useContext(Session);
  if (!session) throw new Error('useSession outside a signed-in page');
  return session;
}
