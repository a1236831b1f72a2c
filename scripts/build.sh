#!/usr/bin/env bash
# Configures and builds the project into build/ (or $BUILD_DIR).
# Extra arguments go to cmake's configure step (e.g. -DKIVO_SANITIZE=ON).
set -euo pipefail
cd "$(dirname "$0")/.."
BUILD_DIR=${BUILD_DIR:-build}
launcher=()
command -v ccache >/dev/null && launcher=(-DCMAKE_CXX_COMPILER_LAUNCHER=ccache -DCMAKE_C_COMPILER_LAUNCHER=ccache)
cmake -S . -B "$BUILD_DIR" -G Ninja "${launcher[@]}" "$@" >/dev/null
ninja -C "$BUILD_DIR"
