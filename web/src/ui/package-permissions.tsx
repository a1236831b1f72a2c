// What a package will be allowed to do once installed, shown on the
// summary of every install and upgrade, right above its Install button (a file, a catalogue
// entry, an upgrade): whether it runs as its own user or as root, its
// memory and process limits (as it declares them, or the appliance's
// defaults), and who signed it.
//
// Contract:
// - `PermissionsSection` shows the facts' `permissions` and holds no
//   state: the root confirmation lives in the flow's `InstallChoices`
//   (`rootConfirmed`), like the licence's.
// - A package that asks for root keeps the user on the summary until the
//   administrator confirms, in words, that it may take full control of the
//   appliance. The package tool itself accepts such a package only when a
//   key of the appliance keyring signed it; the page asks on top of that.

import './package-permissions.css';
import type { PackagePermissions } from '../api/permissions';

export interface PermissionsChoice {
  rootConfirmed?: boolean;
}

function limitText(declared: string | undefined, unit: string): string {
  return declared === undefined ? 'appliance default' : `${declared}${unit}`;
}

// The signer in words: the package tool's line once it checked the file;
// before that (a catalogue entry), that the check is still to come.
function signerText(permissions: PackagePermissions): string {
  return permissions.signature ?? 'checked when the package file is downloaded';
}

export function permissionsRows(permissions: PackagePermissions): { label: string; value: string }[] {
  return [
    { label: 'Runs as', value: permissions.run_as_root ? 'root, with full control of the appliance' : 'a user account of its own, not root' },
    { label: 'Memory limit', value: limitText(permissions.memory_limit_mb, ' MB') },
    { label: 'Process limit', value: limitText(permissions.process_limit, ' processes') },
    { label: 'Signed', value: signerText(permissions) },
  ];
}

export function PermissionsList({ name, permissions }: { name: string; permissions: PackagePermissions }) {
  return (
    <dl class="summary permissions" aria-label={`What ${name} may do`}>
      {permissionsRows(permissions).map((r) => (
        <div key={r.label}>
          <dt>{r.label}</dt>
          <dd>{r.value}</dd>
        </div>
      ))}
    </dl>
  );
}

// The summary's section on what the package may do, with the confirmation
// a root package needs. `onChange` absent: shown, not confirmable.
export function PermissionsSection<C extends PermissionsChoice>({
  name,
  permissions,
  choices,
  onChange,
}: {
  name: string;
  permissions: PackagePermissions;
  choices: C;
  onChange?: (next: C) => void;
}) {
  const root = permissions.run_as_root === true;
  return (
    <section class={root ? 'permissions-page root' : 'permissions-page'} aria-label="Permissions">
      <p>Once installed, {name} will be allowed to do this:</p>
      <PermissionsList name={name} permissions={permissions} />
      {root && (
        <div class="root-request" role="alert">
          <p class="warning">
            <strong>{name} asks to run with full control of the appliance.</strong>
          </p>
          <p>
            It can read and change everything on the appliance: every other package and its data, the accounts and the settings. Allow it
            only if you trust its publisher with the whole appliance.
          </p>
          {onChange && (
            <label class="choice">
              <input type="checkbox" checked={choices.rootConfirmed === true} onChange={(e) => onChange({ ...choices, rootConfirmed: e.currentTarget.checked })} /> I
              allow {name} to run with full control of the appliance
            </label>
          )}
        </div>
      )}
    </section>
  );
}

// What keeps the install from going on: a root package not yet confirmed.
export function permissionsProblem(name: string, permissions: PackagePermissions, choices: PermissionsChoice): string | null {
  return permissions.run_as_root === true && choices.rootConfirmed !== true ? `Confirm that ${name} may run with full control of the appliance.` : null;
}
