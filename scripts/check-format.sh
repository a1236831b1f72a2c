#!/usr/bin/env bash
# Fails when a C++ source of the project differs from what clang-format
# (with the committed .clang-format) would make of it. --fix rewrites them.
set -euo pipefail
cd "$(dirname "$0")/.."
mapfile -t files < <(find bench fuzz host package platform tests tools -name '*.cc' -o -name '*.h' | sort)
if [ "${1:-}" = --fix ]; then
  clang-format -i "${files[@]}"
  exit 0
fi
if ! report=$(clang-format --dry-run --Werror "${files[@]}" 2>&1); then
  grep -m 20 'error:' <<<"$report" >&2 || true
  echo "format: run scripts/check-format.sh --fix" >&2
  exit 1
fi
