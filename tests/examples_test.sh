#!/usr/bin/env bash
# The sample packages, built and signed by examples/build.sh, each installed
# on a fresh root that trusts the demo key, with the outcome it is made for.
set -uo pipefail
BUILD=$1
WORK=$(mktemp -d)
# Packages run as their own accounts, which must pass through the folder
# that holds the root (the tool opens the root itself, not what is above it).
chmod 711 "$WORK"
trap 'KIVO_ROOT=$ROOT $BUILD/bin/kivoctl stop demo-wizard >/dev/null 2>&1; rm -rf "$WORK"' EXIT
"$(dirname "$0")/../examples/build.sh" "$BUILD/bin/kivoctl" "$WORK/out" >/dev/null || exit 1
ROOT=$WORK/root
export KIVO_ROOT=$ROOT
K=$BUILD/bin/kivoctl
$K init-root "$ROOT" >/dev/null
gpg --homedir "$ROOT/usr/kivo/etc/packages/gnupg" --batch --quiet --import "$WORK/out/demo-publisher.asc" 2>/dev/null
failures=0
expect() {  # expect CODE LABEL -- command...
  local want=$1 label=$2; shift 3
  local out; out=$("$@" 2>&1)
  local got=0; [[ $out =~ \[([0-9]+)\] ]] && got=${BASH_REMATCH[1]}
  if [ "$got" != "$want" ]; then echo "FAIL $label: want $want, got $got: $out"; failures=$((failures + 1)); fi
}
P=$WORK/out
expect 268 "notes needs web" -- $K install $P/demo-notes.kpk
expect 0 "web" -- $K install $P/demo-web.kpk
expect 268 "notes needs web running" -- $K install $P/demo-notes.kpk
expect 0 "wizard" -- $K install $P/demo-wizard.kpk --run --wizard '{"greeting": "Servus"}'
grep -q Servus "$ROOT/var/packages/demo-wizard/var/greeting.txt" || { echo "FAIL wizard answer"; failures=$((failures + 1)); }
expect 0 "beta" -- $K install $P/demo-beta.kpk
expect 303 "future" -- $K install $P/demo-future.kpk
expect 288 "unsigned at trust level 0" -- $K install $P/demo-unsigned.kpk
sed -i 's/^pkg_source_trust_level=.*/pkg_source_trust_level="1"/' "$ROOT/etc/kivoinfo.conf"
expect 0 "unsigned at trust level 1" -- $K install $P/demo-unsigned.kpk
sed -i 's/^pgsql=.*/pgsql="stopped"/' "$ROOT/etc/kivo/services.conf"
expect 260 "db needs pgsql" -- $K install $P/demo-db.kpk
sed -i 's/^pgsql=.*/pgsql="running"/' "$ROOT/etc/kivo/services.conf"
expect 0 "db" -- $K install $P/demo-db.kpk
said=$($K uninstall demo-wizard --wizard '{"keep_copy": true}' 2>&1)
echo "$said" | grep -qx "Your greeting was: Servus" || { echo "FAIL uninstall wizard answer: $said"; failures=$((failures + 1)); }
echo "$failures failed"
[ "$failures" = 0 ]
