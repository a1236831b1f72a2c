// Not built yet: says so rather than showing anything made up.
export function ManualInstallScreen() {
  return <p class="hint">This screen is not built yet.</p>;
}
