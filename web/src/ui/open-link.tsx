import './open-link.css';

// "Open": a running package's own web page, in a new tab. Only web
// addresses become links: a package's INFO could hold anything.
export function OpenLink({ name, url }: { name: string; url: string | string[] | undefined }) {
  const address = (Array.isArray(url) ? url : [url]).find((u): u is string => !!u && /^https?:\/\//i.test(u));
  if (!address) return null;
  return (
    <a class="open-link" href={address} target="_blank" rel="noopener noreferrer" aria-label={`Open ${name}`}>
      Open
    </a>
  );
}
