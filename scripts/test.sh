#!/usr/bin/env bash
# Installs what is missing (as root), builds, and runs every test: once in
# build/, then again under AddressSanitizer and UndefinedBehaviorSanitizer in
# build-asan/. KIVO_SANITIZE=0 skips the second run, KIVO_SANITIZE=only runs
# just that one. Last, a short fuzz run of the readers of untrusted input
# (fuzz/run.sh, clang, build-fuzz/); KIVO_FUZZ=0 skips it. The package
# center page's checks and browser tests run after the plain run
# (scripts/test-page.sh); KIVO_PAGE=0 skips them.
set -euo pipefail
cd "$(dirname "$0")/.."

scripts/deps.sh --tests

# The committed .clang-format is the style; a change that drifts from it
# fails here, before any build, so reviews never argue about layout.
scripts/check-format.sh

run_tests() {
  (cd "$BUILD_DIR" && ctest -j"$(nproc)" --output-on-failure --timeout 300)
}

if [ "${KIVO_SANITIZE:-1}" != only ]; then
  export BUILD_DIR=build
  scripts/build.sh
  run_tests
  [ "${KIVO_PAGE:-1}" = 0 ] || scripts/test-page.sh
fi
if [ "${KIVO_SANITIZE:-1}" != 0 ]; then
  export BUILD_DIR=build-asan
  export UBSAN_OPTIONS=halt_on_error=1:print_stacktrace=1
  scripts/build.sh -DKIVO_SANITIZE=ON
  run_tests
fi
if [ "${KIVO_FUZZ:-1}" != 0 ]; then
  # Saved reproducers first, then about 20 s per target; a crash fails here.
  fuzz/run.sh 20
fi
