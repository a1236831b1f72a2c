import { useEffect, useState } from 'preact/hooks';

// The page's place lives in the address's fragment (#/installed,
// #/package/<id>, #/activity/<id> for one package's activity), so reloading
// or opening a second tab lands on the same screen.
export interface Route {
  screen: 'installed' | 'catalogue' | 'manual' | 'settings' | 'package' | 'activity';
  id?: string;
}

const kScreens: Route['screen'][] = ['installed', 'catalogue', 'manual', 'settings', 'package', 'activity'];

export function parseRoute(hash: string): Route {
  const [screen, id] = hash.replace(/^#\/?/, '').split('/');
  if (screen === 'package' && id) return { screen, id: decodeURIComponent(id) };
  if (screen === 'activity' && id) return { screen, id: decodeURIComponent(id) };
  const known = kScreens.find((s) => s === screen && s !== 'package');
  return { screen: known ?? 'installed' };
}

export function routeHref(route: Route): string {
  return route.id ? `#/${route.screen}/${encodeURIComponent(route.id)}` : `#/${route.screen}`;
}

function sameRoute(a: Route, b: Route): boolean {
  return a.screen === b.screen && a.id === b.id;
}

export function useRoute(): Route {
  const [route, setRoute] = useState(() => parseRoute(location.hash));
  useEffect(() => {
    const follow = () => {
      const next = parseRoute(location.hash);
      setRoute((current) => (sameRoute(current, next) ? current : next));
    };
    addEventListener('hashchange', follow);
    // The listener starts after the first paint: an address changed
    // before it (a link followed, or a tab opened, as the page appears)
    // sent its hashchange to nobody, so read the address once more.
    follow();
    return () => removeEventListener('hashchange', follow);
  }, []);
  return route;
}
