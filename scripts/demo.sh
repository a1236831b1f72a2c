#!/usr/bin/env bash
# The appliance's web API on 127.0.0.1 with a demo system root, in the
# foreground until Ctrl-C.
#
#   scripts/demo.sh [PORT]        (default 5000, or $PORT)
#
# Installs what is missing (as root), builds, creates demo-root/ inside the
# checkout with the account admin (password $KIVO_DEMO_PASSWORD, default
# "admin"), and serves it with lighttpd, with the package watchdog beside it.
set -euo pipefail
cd "$(dirname "$0")/.."
PORT=${1:-${PORT:-5000}}
PASSWORD=${KIVO_DEMO_PASSWORD:-admin}
export KIVO_DEMO_PASSWORD=$PASSWORD

scripts/deps.sh
scripts/build.sh

ROOT=$PWD/demo-root
scripts/build-page.sh
scripts/demo-root.sh "$ROOT" "$PORT"
K="build/bin/kivoctl --root $ROOT"
# Runs `kivoctl ACTION` on each of the ids in FILE, in passes, until a pass
# changes nothing: a package that needs another (demo-notes needs demo-web)
# starts only after it and must stop before it, whatever the order.
in_passes() {
  local action=$1 file=$2 left
  left=$(cat "$file")
  while [ -n "$left" ]; do
    local failed=""
    for id in $left; do $K "$action" "$id" >/dev/null 2>&1 || failed="$failed $id"; done
    [ "$(echo $failed)" = "$(echo $left)" ] && break
    left=$failed
  done
  for id in $left; do echo "could not $action $id" >&2; done
}
# What the last run stopped runs again.
if [ -f "$ROOT/.stopped-by-demo" ]; then
  in_passes start "$ROOT/.stopped-by-demo"
  rm -f "$ROOT/.stopped-by-demo"
fi

cat <<TXT

The package center of $ROOT:
  http://127.0.0.1:$PORT/                      account: admin   password: $PASSWORD
  web API: http://127.0.0.1:$PORT/webapi/entry.cgi
Installed: $($K list | tr '\n' ';')
Sample package files: $ROOT/volume1/public/packages
Package server: http://127.0.0.1:$PORT/feed/catalogue.json
Community feed (add it through the API): http://127.0.0.1:$PORT/community/catalogue.json
Try the curl lines of README.md. Ctrl-C stops the server and the packages.

TXT
# The demo's packages end with it: a service left running (demo-web on its
# port above all) would stand in the way of the next demo or of the tests.
# They run again when the demo starts again.
STOPPED=$ROOT/.stopped-by-demo
stop_packages() {
  $K list | awk '$NF == "running" {print $1}' >"$STOPPED.tmp" && mv "$STOPPED.tmp" "$STOPPED"
  in_passes stop "$STOPPED"
  echo "stopped: $(tr '\n' ' ' <"$STOPPED")"
}
# The watchdog runs beside lighttpd (its lines in $ROOT/watchdog.log) and
# ends first, so that it never meets the packages the demo stops.
$K watchdog >>"$ROOT/watchdog.log" 2>&1 &
WATCHDOG=$!
echo "watchdog: pid $WATCHDOG, its log $ROOT/watchdog.log"
end_demo() {
  kill -TERM "$WATCHDOG" 2>/dev/null && wait "$WATCHDOG" || true
  stop_packages
}
trap end_demo EXIT
/usr/sbin/lighttpd -D -f "$ROOT/lighttpd.conf" &
LIGHTTPD=$!
# Ctrl-C, or a TERM sent to this script (kill PID), ends lighttpd; the shell
# then goes on to the trap above. (lighttpd, started in the background,
# does not see Ctrl-C itself.)
trap 'kill -TERM "$LIGHTTPD" 2>/dev/null || true' INT TERM
while kill -0 "$LIGHTTPD" 2>/dev/null; do
  wait "$LIGHTTPD" || true
done
