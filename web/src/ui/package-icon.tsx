import { useSession } from '../session';

// An installed package's icon, loaded by URL (the cookie is enough for
// images, docs/images.md). The API sends the package center's own icon when
// the package has none, so there is always a picture. Icons below the fold
// load only when scrolled to, so a long list costs a request per visible row
// and not per package.
export function PackageIcon({ id, version, size = 72, shown = 48 }: { id: string; version: string; size?: 72 | 256; shown?: number }) {
  const { api } = useSession();
  const src = api.url('KIVO.Core.Package.Thumb', 'get', 1, { name: id, ver: version, size });
  return <img class="package-icon" src={src} alt="" width={shown} height={shown} loading="lazy" decoding="async" />;
}
