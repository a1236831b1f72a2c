#!/usr/bin/env bash
# Checks and tests the package center page: type checks and lint, the
# build (and its JavaScript budget), then the browser tests in Debian's
# chromium against real appliances made from build/ or $BUILD_DIR
# (scripts/demo-root.sh). Screenshots of each screen land in its screenshots/.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/build-page.sh
cd web
npm run --silent check
# The appliance serves the page over slow links too: all its JavaScript,
# gzipped, stays under 150 KB.
total=0
for f in "../${BUILD_DIR:-build}"/page/assets/*.js; do total=$((total + $(gzip -9c "$f" | wc -c))); done
echo "page JavaScript: $total bytes gzipped"
if [ "$total" -ge 153600 ]; then
  echo "the page's JavaScript is over its 150 KB budget" >&2
  exit 1
fi
npm run --silent e2e
