// Display names of the installed packages, for words that name packages an
// answer gives by id ("Not running: Demo Web.", not "demo-web").

import { useEffect, useState } from 'preact/hooks';
import type { Api } from '../api/client';
import type { NameOf } from '../api/messages';
import { listPackages } from '../api/package';

// Reads the installed packages once, while `wanted` (a failure to word is
// shown); until then, and for a package not installed, the id stays.
export function usePackageNames(api: Api, wanted: boolean): NameOf {
  const [known, setKnown] = useState<Map<string, string> | null>(null);
  useEffect(() => {
    if (!wanted || known) return;
    let live = true;
    void listPackages(api, []).then((answer) => {
      if (live && answer.ok) setKnown(new Map(answer.data.packages.map((p) => [p.id, p.name])));
    });
    return () => {
      live = false;
    };
  }, [api, wanted, known]);
  return (id) => known?.get(id) ?? id;
}
