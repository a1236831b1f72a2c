#!/usr/bin/env bash
# Makes (or brings up to date) a demo system root served on 127.0.0.1:PORT:
# the account admin, the sample packages (two of them installed and
# running), the vendor's package server under /feed/, a community feed under
# /community/, the package center page at / and ROOT/lighttpd.conf. Both the
# demo and the page's browser tests use it; it expects a finished build in
# build/ (or $BUILD_DIR).
#
#   scripts/demo-root.sh ROOT PORT [cgi|scgi]     password: $KIVO_DEMO_PASSWORD (admin)
#
# demo-web serves its page on $DEMO_WEB_PORT (8095): appliances that run on
# one machine at once (the demo, each browser test's) give it ports of their
# own.
set -euo pipefail
cd "$(dirname "$0")/.."
ROOT=$1
PORT=$2
MODE=${3:-scgi}
PASSWORD=${KIVO_DEMO_PASSWORD:-admin}

BUILD=${BUILD_DIR:-build}
K="$BUILD/bin/kivoctl --root $ROOT"
$BUILD/bin/kivoctl init-root "$ROOT"
$K user-add admin --password "$PASSWORD" --group administrators
# The web API runs in kivo-webd behind lighttpd's SCGI module (a forked
# process per request; lighttpd starts it and starts it again if it ends).
# Mode cgi runs entry.cgi per request instead.
$K web-config --mode "$MODE" --port "$PORT" > "$ROOT/lighttpd.conf"

# The sample packages, built for this root (demo-web's port) and signed by a
# demo publisher key that this root trusts.
SAMPLES=$ROOT/.samples
examples/build.sh "$PWD/$BUILD/bin/kivoctl" "$SAMPLES" >/dev/null
gpg --homedir "$ROOT/usr/kivo/etc/packages/gnupg" --batch --quiet --import \
  "$SAMPLES/demo-publisher.asc" 2>/dev/null
mkdir -p "$ROOT/volume1/public/packages"
cp "$SAMPLES"/*.kpk "$ROOT/volume1/public/packages/"

# The two installed packages come from the vendor's package server, as on an
# appliance, so that their records name the vendor as their origin and the
# vendor's later catalogue (below) offers them upgrades. At first the server
# offers just these versions, served for the moment by PHP's built-in web
# server on the demo's port (lighttpd does not run yet); the catalogue it
# leaves in the cache goes with it.
FEED=$ROOT/usr/kivo/www/feed
if ! $K status demo-web >/dev/null 2>&1 || ! $K status demo-notes >/dev/null 2>&1; then
  rm -rf "$FEED" && mkdir -p "$FEED"
  cp "$SAMPLES/demo-web.kpk" "$SAMPLES/demo-notes.kpk" "$FEED/"
  $K index "$FEED" --base-url "http://127.0.0.1:$PORT/feed" >/dev/null
  $K server-config --vendor "http://127.0.0.1:$PORT/feed/catalogue.json" >/dev/null
  php -S "127.0.0.1:$PORT" -t "$ROOT/usr/kivo/www" >/dev/null 2>&1 &
  SERVER=$!
  for _ in $(seq 50); do
    (exec 3<>"/dev/tcp/127.0.0.1/$PORT") 2>/dev/null && break
    sleep 0.1
  done
  for pkg in demo-web demo-notes; do
    $K status $pkg >/dev/null 2>&1 || $K install-server $pkg --run || true
  done
  kill "$SERVER" && wait "$SERVER" 2>/dev/null || true
  rm -rf "$ROOT/var/cache/kivo/pkgserver"
fi

# The vendor's package server: a static catalogue that kivoctl index makes
# from the sample packages, served by the same lighttpd under /feed/. It
# offers packages that are not installed (one of them a beta), a newer
# demo-web (an upgrade badge), and demo-gone, whose file is withdrawn after
# indexing so that its download fails cleanly.
rm -rf "$FEED" && mkdir -p "$FEED"
for pkg in demo-beta demo-db demo-notes demo-web-update demo-wizard demo-gone; do
  cp "$SAMPLES/$pkg.kpk" "$FEED/"
done
$K index "$FEED" --base-url "http://127.0.0.1:$PORT/feed" --recommend demo-web --recommend demo-beta >/dev/null
rm "$FEED/demo-gone.kpk"
# Both catalogues are served on loopback, so this root lets package images
# come from loopback and private addresses, which an appliance refuses by
# default (docs/images.md).
$K server-config --vendor "http://127.0.0.1:$PORT/feed/catalogue.json" \
  --company-info "http://127.0.0.1:$PORT/feed/company-info.json" \
  --allow-private-image-addresses yes >/dev/null
# The terms-of-service endpoint answers the hash of the current terms; the
# package center asks the user to agree again whenever it changes.
cp examples/terms-of-service.txt "$FEED/terms-of-service.txt"
printf '{"content_hash":"%s"}\n' "$(sha256sum examples/terms-of-service.txt | cut -d' ' -f1)" \
  >"$FEED/company-info.json"

# A second catalogue, a "community" feed that a user adds through the API:
# demo-unsigned signed by a community key made here (never committed),
# whose public key the catalogue publishes in its "keyrings". The appliance
# keyring does not hold it: only packages downloaded from this feed verify.
COMMUNITY=$ROOT/usr/kivo/www/community
COMMUNITY_GPG=$ROOT/community-gnupg
rm -rf "$COMMUNITY" "$COMMUNITY_GPG" && mkdir -p "$COMMUNITY" && mkdir -m 700 "$COMMUNITY_GPG"
gpg --homedir "$COMMUNITY_GPG" --batch --quiet --passphrase '' --quick-gen-key \
  "KIVO Community Publisher <community@kivo.invalid>" ed25519 sign never 2>/dev/null
CKEY=$(gpg --homedir "$COMMUNITY_GPG" --batch --with-colons --list-secret-keys | awk -F: '/^fpr/ {print $10; exit}')
cp "$SAMPLES/demo-unsigned.kpk" "$COMMUNITY/"
$BUILD/bin/kivoctl sign "$COMMUNITY/demo-unsigned.kpk" --homedir "$COMMUNITY_GPG" --key "$CKEY" >/dev/null
$K index "$COMMUNITY" --base-url "http://127.0.0.1:$PORT/community" >/dev/null
gpg --homedir "$COMMUNITY_GPG" --batch --armor --export "$CKEY" >"$COMMUNITY_GPG/community.asc"
php -r '$f = $argv[1]; $c = json_decode(file_get_contents($f), true);
  $c["keyrings"] = [file_get_contents($argv[2])];
  file_put_contents($f . ".tmp", json_encode($c, JSON_PRETTY_PRINT | JSON_UNESCAPED_SLASHES) . "\n");
  rename($f . ".tmp", $f);' "$COMMUNITY/catalogue.json" "$COMMUNITY_GPG/community.asc"
gpgconf --homedir "$COMMUNITY_GPG" --kill gpg-agent 2>/dev/null || true


# The package center page, built by scripts/build-page.sh.
cp -r "$BUILD/page/." "$ROOT/usr/kivo/www/"
