#!/usr/bin/env bash
# The appliance's web API on 127.0.0.1 with a demo system root, in the
# foreground until Ctrl-C.
#
#   scripts/demo.sh [PORT]        (default 5000, or $PORT)
#
# Installs what is missing (as root), builds, creates demo-root/ inside the
# checkout with the account admin (password $KIVO_DEMO_PASSWORD, default
# "admin"), and serves it with lighttpd.
set -euo pipefail
cd "$(dirname "$0")/.."
PORT=${1:-${PORT:-5000}}
PASSWORD=${KIVO_DEMO_PASSWORD:-admin}

scripts/deps.sh
scripts/build.sh

ROOT=$PWD/demo-root
K="build/bin/kivoctl --root $ROOT"
build/bin/kivoctl init-root "$ROOT"
$K user-add admin --password "$PASSWORD" --group administrators
$K web-config --port "$PORT" > "$ROOT/lighttpd.conf"

# The sample packages, signed by a demo publisher key that this root trusts.
examples/build.sh "$PWD/build/bin/kivoctl" "$PWD/build/examples"
gpg --homedir "$ROOT/usr/kivo/etc/packages/gnupg" --batch --quiet --import \
  build/examples/demo-publisher.asc 2>/dev/null
mkdir -p "$ROOT/volume1/public/packages"
cp build/examples/*.kpk "$ROOT/volume1/public/packages/"
for pkg in demo-web demo-notes; do
  $K status $pkg >/dev/null 2>&1 || $K install "build/examples/$pkg.kpk" --run || true
done

# The vendor's package server: a static catalogue that kivoctl index makes
# from the sample packages, served by the same lighttpd under /feed/. It
# offers packages that are not installed (one of them a beta), a newer
# demo-web (an upgrade badge), and demo-gone, whose file is withdrawn after
# indexing so that its download fails cleanly.
FEED=$ROOT/usr/kivo/www/feed
rm -rf "$FEED" && mkdir -p "$FEED"
for pkg in demo-beta demo-db demo-notes demo-web-update demo-wizard demo-gone; do
  cp "build/examples/$pkg.kpk" "$FEED/"
done
$K index "$FEED" --base-url "http://127.0.0.1:$PORT/feed" --recommend demo-web --recommend demo-beta >/dev/null
rm "$FEED/demo-gone.kpk"
$K server-config --vendor "http://127.0.0.1:$PORT/feed/catalogue.json" \
  --company-info "http://127.0.0.1:$PORT/feed/company-info.json" >/dev/null

cat <<TXT

The web API of $ROOT:
  http://127.0.0.1:$PORT/webapi/entry.cgi      account: admin   password: $PASSWORD
Installed: $($K list | tr '\n' ';')
Sample package files: $ROOT/volume1/public/packages
Package server: http://127.0.0.1:$PORT/feed/catalogue.json
Try the curl lines of README.md. Ctrl-C stops the server.

TXT
exec /usr/sbin/lighttpd -D -f "$ROOT/lighttpd.conf"
