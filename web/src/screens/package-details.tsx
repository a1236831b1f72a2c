// Not built yet: says so rather than showing anything made up.
export function PackageScreen({ id }: { id: string }) {
  return <p class="hint">The details of {id} are not built yet.</p>;
}
