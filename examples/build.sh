#!/usr/bin/env bash
# Builds the sample packages into OUT with kivoctl (each with icons of its
# own that kivoctl draws), signs all but demo-unsigned with the demo
# publisher key, and exports that key.
#
#   examples/build.sh KIVOCTL OUT        (demo-web's port: $DEMO_WEB_PORT, 8095)
#
# The key is made once, in OUT/gnupg, and never committed. demo-web's
# sources say port 8095; each appliance on one machine needs a port of its
# own for it, so the port is written into the package as it is built.
set -euo pipefail
KIVOCTL=$1
OUT=$2
HERE=$(cd "$(dirname "$0")" && pwd)
DEMO_WEB_PORT=${DEMO_WEB_PORT:-8095}
if ! [[ $DEMO_WEB_PORT =~ ^[1-9][0-9]{0,4}$ ]] || [ "$DEMO_WEB_PORT" -gt 65535 ]; then
  echo "DEMO_WEB_PORT must be a port number, not '$DEMO_WEB_PORT'" >&2
  exit 1
fi
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
  case $name in
    demo-web*) sed -i "s/8095/$DEMO_WEB_PORT/g" "$work/INFO" "$work/package/bin/daemon" ;;
  esac
  # Packages with a service but no script of their own use the common one.
  if [ ! -e "$work/scripts/start-stop-status" ] && grep -q 'startable="yes"' "$work/INFO"; then
    mkdir -p "$work/scripts" "$work/package/bin"
    cp "$HERE/common/start-stop-status" "$work/scripts/"
    [ -e "$work/package/bin/daemon" ] || cp "$HERE/common/daemon" "$work/package/bin/"
  fi
  # Each sample gets icons of its own, drawn by kivoctl at build rather than
  # committed as pictures: a tile in its id's colour bearing the initial of
  # its name after "demo-".
  if [ ! -e "$work/PACKAGE_ICON.PNG" ]; then
    initial=${name#demo-}
    "$KIVOCTL" icon "$work" --letter "${initial:0:1}" >/dev/null
  fi
  "$KIVOCTL" build "$work" "$OUT/$name.kpk" >/dev/null
  [ "$name" = demo-unsigned ] || "$KIVOCTL" sign "$OUT/$name.kpk" --homedir "$GNUPGHOME" --key "$KEY" >/dev/null
  rm -rf "$work"
done
# Signing started an agent for this key folder; it is not needed any more.
gpgconf --homedir "$GNUPGHOME" --kill gpg-agent 2>/dev/null || true
echo "sample packages in $OUT"
