#!/usr/bin/env bash
# Builds the sample packages of examples/ with KIVOCTL (signed, as the demo
# has them) and puts the package files into SEEDS, the package-file fuzz
# target's seed corpus.
#
#   fuzz/make-package-seeds.sh KIVOCTL SEEDS
set -euo pipefail
KIVOCTL=$1
SEEDS=$2
HERE=$(cd "$(dirname "$0")" && pwd)
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
# kivoctl of the fuzz build carries the sanitizers; a leak at its exit is
# not what this step looks for.
if ! ASAN_OPTIONS=detect_leaks=0 "$HERE/../examples/build.sh" "$KIVOCTL" "$work/out" \
  >"$work/log" 2>&1; then
  cat "$work/log" >&2
  exit 1
fi
rm -rf "$SEEDS"
mkdir -p "$SEEDS"
cp "$work"/out/*.kpk "$SEEDS/"
touch "$SEEDS.made"
