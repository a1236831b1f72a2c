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
build/bin/kivoctl init-root "$ROOT"
build/bin/kivoctl --root "$ROOT" user-add admin --password "$PASSWORD" --group administrators
build/bin/kivoctl --root "$ROOT" web-config --port "$PORT" > "$ROOT/lighttpd.conf"

cat <<TXT

The web API of $ROOT:
  http://127.0.0.1:$PORT/webapi/entry.cgi      account: admin   password: $PASSWORD
Try the curl lines of README.md. Ctrl-C stops the server.

TXT
exec /usr/sbin/lighttpd -D -f "$ROOT/lighttpd.conf"
