#!/usr/bin/env bash
# Builds the sample packages into OUT with kivoctl, signs all but
# demo-unsigned with the demo publisher key, and exports that key.
#
#   examples/build.sh KIVOCTL OUT
#
# The key is made once, in OUT/gnupg, and never committed.
set -euo pipefail
KIVOCTL=$1
OUT=$2
HERE=$(cd "$(dirname "$0")" && pwd)
mkdir -p "$OUT"
export GNUPGHOME="$OUT/gnupg"
if [ ! -d "$GNUPGHOME" ]; then
  mkdir -m 700 "$GNUPGHOME"
  gpg --batch --quiet --passphrase '' --quick-gen-key \
    "KIVO Demo Publisher <demo@kivo.invalid>" ed25519 sign never 2>/dev/null
fi
KEY=$(gpg --batch --with-colons --list-secret-keys | awk -F: '/^fpr/ {print $10; exit}')
gpg --batch --armor --export "$KEY" >"$OUT/demo-publisher.asc"

for src in "$HERE"/packages/*/; do
  name=$(basename "$src")
  work=$(mktemp -d)
  cp -a "$src/." "$work/"
  # Packages with a service but no script of their own use the common one.
  if [ ! -e "$work/scripts/start-stop-status" ] && grep -q 'startable="yes"' "$work/INFO"; then
    mkdir -p "$work/scripts" "$work/package/bin"
    cp "$HERE/common/start-stop-status" "$work/scripts/"
    [ -e "$work/package/bin/daemon" ] || cp "$HERE/common/daemon" "$work/package/bin/"
  fi
  "$KIVOCTL" build "$work" "$OUT/$name.kpk" >/dev/null
  [ "$name" = demo-unsigned ] || "$KIVOCTL" sign "$OUT/$name.kpk" --homedir "$GNUPGHOME" --key "$KEY" >/dev/null
  rm -rf "$work"
done
# Signing started an agent for this key folder; it is not needed any more.
gpgconf --homedir "$GNUPGHOME" --kill gpg-agent 2>/dev/null || true
echo "sample packages in $OUT"
