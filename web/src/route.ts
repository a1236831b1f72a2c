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

export function useRoute(): Route {
  const [route, setRoute] = useState(() => parseRoute(location.hash));
  useEffect(() => {
    const follow = () => setRoute(parseRoute(location.hash));
    addEventListener('hashchange', follow);
    return () => removeEventListener('hashchange', follow);
  }, []);
  return route;
}
