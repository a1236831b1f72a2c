#!/usr/bin/env bash
# Builds the package center page (web/) into build/page (or $BUILD_DIR/page) with the exact
# packages of web/package-lock.json. Needs Node.js 20.19 or newer and npm.
set -euo pipefail
cd "$(dirname "$0")/../web"
# npm ci starts from scratch each time; skip it while node_modules matches
# the lock file it was installed from.
if ! cmp -s package-lock.json node_modules/.package-lock.json.installed 2>/dev/null; then
  npm ci --no-audit --no-fund --loglevel=error
  cp package-lock.json node_modules/.package-lock.json.installed
fi
BUILD=${BUILD_DIR:-build}
case $BUILD in /*) ;; *) BUILD="$(cd .. && pwd)/$BUILD" ;; esac
KIVO_PAGE_OUT=$BUILD/page npx vite build --logLevel warn
