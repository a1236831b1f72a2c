#!/usr/bin/env bash
# Installs what is missing (as root), builds, and runs every test.
# With KIVO_SANITIZE=1 the build and the tests run under ASan and UBSan,
# in build-asan/.
set -euo pipefail
cd "$(dirname "$0")/.."

scripts/deps.sh
if [ "${KIVO_SANITIZE:-0}" = 1 ]; then
  export BUILD_DIR=build-asan
  scripts/build.sh -DKIVO_SANITIZE=ON
else
  export BUILD_DIR=build
  scripts/build.sh
fi
cd "$BUILD_DIR"
ctest -j"$(nproc)" --output-on-failure --timeout 300
