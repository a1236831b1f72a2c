import { useEffect, useMemo, useState } from 'preact/hooks';
import { Api, isSessionGone, type SessionInfo } from './api/client';
import { messageFor } from './api/messages';
import { Session } from './session';
import { routeHref, useRoute, type Route } from './route';
import { NotAdministratorScreen, SignInScreen } from './screens/sign-in';
import { InstalledScreen } from './screens/installed';
import { PackageScreen } from './screens/package-details';
import { CatalogueScreen } from './screens/catalogue';
import { ManualInstallScreen } from './screens/manual-install';
import { SettingsScreen } from './screens/settings';
import { TermsGate } from './screens/terms';
import { ActivityScreen } from './screens/activity';

type State = { kind: 'loading' } | { kind: 'signed-out'; notice?: string } | { kind: 'signed-in'; session: SessionInfo };

const kTabs: { screen: Route['screen']; label: string }[] = [
  { screen: 'installed', label: 'Installed' },
  { screen: 'catalogue', label: 'All packages' },
  { screen: 'manual', label: 'Manual install' },
  { screen: 'settings', label: 'Settings' },
  { screen: 'activity', label: 'Activity' },
];

function Screen({ route }: { route: Route }) {
  switch (route.screen) {
    case 'package':
      return <PackageScreen id={route.id ?? ''} />;
    case 'catalogue':
      return <CatalogueScreen />;
    case 'manual':
      return <ManualInstallScreen />;
    case 'settings':
      return <SettingsScreen />;
    case 'activity':
      return <ActivityScreen packageId={route.id} />;
    default:
      return <InstalledScreen />;
  }
}

function Shell({ api, session, onSignOut }: { api: Api; session: SessionInfo; onSignOut: () => void }) {
  const route = useRoute();
  const context = useMemo(() => ({ api, account: session.account }), [api, session.account]);
  const current = route.screen === 'package' ? 'installed' : route.screen;
  return (
    <Session.Provider value={context}>
      <header class="top">
        <span class="brand">Package Center</span>
        <nav aria-label="Sections">
          {kTabs.map((tab) => (
            <a key={tab.screen} href={routeHref({ screen: tab.screen })} aria-current={current === tab.screen ? 'page' : undefined}>
              {tab.label}
            </a>
          ))}
        </nav>
        <span class="account">
          {session.account}
          <button type="button" onClick={onSignOut}>
            Sign out
          </button>
        </span>
      </header>
      <TermsGate>
        <main class="content">
          <Screen route={route} />
        </main>
      </TermsGate>
    </Session.Provider>
  );
}

export function App() {
  const api = useMemo(() => new Api(), []);
  const [state, setState] = useState<State>({ kind: 'loading' });
  useEffect(() => {
    api.onSessionEnded = (code) => setState({ kind: 'signed-out', notice: messageFor({ code }) });
    api.restoreSession().then((r) => {
      if (r.ok) setState({ kind: 'signed-in', session: r.data });
      // Not signed in is the usual start; anything else is worth telling.
      else setState({ kind: 'signed-out', notice: isSessionGone(r.error.code) ? undefined : messageFor(r.error) });
    });
  }, [api]);
  const signOut = async () => {
    const result = await api.signOut();
    // A session the server has already ended is signed out all the same.
    const failed = !result.ok && !isSessionGone(result.error.code);
    setState({ kind: 'signed-out', notice: failed ? `Signing out failed: ${messageFor(result.error)}` : 'Signed out.' });
  };
  if (state.kind === 'loading') return <p class="loading">Loading…</p>;
  if (state.kind === 'signed-out')
    return <SignInScreen api={api} notice={state.notice} onSignedIn={(session) => setState({ kind: 'signed-in', session })} />;
  if (!state.session.administrator) return <NotAdministratorScreen account={state.session.account} onSignOut={signOut} />;
  return <Shell api={api} session={state.session} onSignOut={signOut} />;
}
