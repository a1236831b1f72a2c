import { iconUrl } from '../api/images';
import { useSession } from '../session';

// An installed package's icon, loaded by URL (the cookie is enough for
// images, docs/images.md). The API sends the package center's own icon when
// the package has none, so there is always a picture. Icons below the fold
// load only when scrolled to, so a long list costs a request per visible row
// and not per package.
export function PackageIcon({ id, version, size = 72, shown = 48 }: { id: string; version: string; size?: 72 | 256; shown?: number }) {
  const { api } = useSession();
  return <img class="package-icon" src={iconUrl(api, id, version, size)} alt="" width={shown} height={shown} loading="lazy" decoding="async" />;
}
