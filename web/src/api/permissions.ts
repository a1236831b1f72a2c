// What a package will be allowed to do once installed (docs/http-api.md,
// "Fields of our own"): "permissions" in the answers of "upload" and of
// "Download" "check", and the same INFO keys in a catalogue entry
// (docs/package-server.md), which the page has before any download.

import type { ServerEntry } from './server';

export interface PackagePermissions {
  run_as_root?: boolean;
  // As INFO declares them; absent: the appliance's defaults apply.
  memory_limit_mb?: string;
  process_limit?: string;
  // The package tool's line on the file's signature; absent before the
  // file is checked (a catalogue entry).
  signature?: string;
}

function declared(value: unknown): string | undefined {
  return typeof value === 'string' && value !== '' ? value : undefined;
}

// What a catalogue entry says, in the answers' form. A catalogue carries
// INFO's text: "yes" (in any case) asks for root, as the package tool reads it.
export function entryPermissions(entry: ServerEntry): PackagePermissions {
  const keys = entry as unknown as Record<string, unknown>;
  const root = declared(keys.run_as_root)?.toLowerCase();
  return {
    run_as_root: root === 'yes' || root === 'true' || root === '1',
    memory_limit_mb: declared(keys.memory_limit_mb),
    process_limit: declared(keys.process_limit),
  };
}
