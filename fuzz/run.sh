#!/usr/bin/env bash
# Builds the fuzz targets (clang, libFuzzer, ASan + UBSan) in build-fuzz/ (or
# $FUZZ_BUILD_DIR), replays every saved reproducer of fuzz/regressions/, then
# fuzzes each target for SECONDS (default 20). Exits non-zero when a
# reproducer or the fuzzing crashes; crashes land in
# <build>/fuzz/crashes/<target>/, the grown corpus in <build>/fuzz/corpus/<target>/.
#
#   fuzz/run.sh [SECONDS [TARGET...]]     targets: package_file params multipart catalogue
#
# FUZZ_FLAGS adds libFuzzer flags (e.g. "-jobs=4 -workers=2").
set -euo pipefail
cd "$(dirname "$0")/.."
SECONDS_EACH=${1:-20}
shift || true
TARGETS=("$@")
[ ${#TARGETS[@]} -gt 0 ] || TARGETS=(package_file params multipart catalogue)
BUILD=$PWD/${FUZZ_BUILD_DIR:-build-fuzz}

launcher=()
command -v ccache >/dev/null && launcher=(-DCMAKE_CXX_COMPILER_LAUNCHER=ccache -DCMAKE_C_COMPILER_LAUNCHER=ccache)
CC=clang CXX=clang++ cmake -S . -B "$BUILD" -G Ninja "${launcher[@]}" \
  -DKIVO_FUZZ=ON -DBUILD_TESTING=OFF >/dev/null
ninja -C "$BUILD" kivo_fuzz

export UBSAN_OPTIONS=halt_on_error=1:print_stacktrace=1
# Scratch folders of the targets (and of a crashed run) stay in the build.
export TMPDIR=$BUILD/fuzz/tmp
rm -rf "$TMPDIR"
mkdir -p "$TMPDIR"

failed=()
for target in "${TARGETS[@]}"; do
  program=$BUILD/bin/${target}_fuzzer
  regressions=("$PWD"/fuzz/regressions/"$target"/*)
  if [ -e "${regressions[0]}" ]; then
    echo "== $target: replaying ${#regressions[@]} saved reproducer(s)"
    if ! "$program" -timeout=10 "${regressions[@]}" >"$BUILD/fuzz/$target-regressions.log" 2>&1; then
      tail -n 60 "$BUILD/fuzz/$target-regressions.log" >&2
      failed+=("$target (a saved reproducer)")
      continue
    fi
  fi
  corpus=$BUILD/fuzz/corpus/$target
  crashes=$BUILD/fuzz/crashes/$target
  mkdir -p "$corpus" "$crashes"
  seeds=()
  for dir in "$PWD"/fuzz/seeds/"$target" "$BUILD/fuzz/seeds/$target"; do
    [ -d "$dir" ] && seeds+=("$dir")
  done
  dict=()
  [ -f "$PWD/fuzz/$target.dict" ] && dict=(-dict="$PWD/fuzz/$target.dict")
  echo "== $target: fuzzing for ${SECONDS_EACH}s"
  # Run from the build's fuzz folder: with -jobs, libFuzzer writes a log per
  # job into the current folder.
  # shellcheck disable=SC2086 # FUZZ_FLAGS is a list of flags
  if ! (cd "$BUILD/fuzz" && "$program" -max_total_time="$SECONDS_EACH" -timeout=10 \
    -rss_limit_mb=2048 -print_final_stats=1 -artifact_prefix="$crashes/" "${dict[@]}" ${FUZZ_FLAGS:-} \
    "$corpus" "${seeds[@]}" >"$BUILD/fuzz/$target.log" 2>&1); then
    tail -n 60 "$BUILD/fuzz/$target.log" >&2
    failed+=("$target")
    continue
  fi
  grep -E '^stat::number_of_executed_units|^Done' "$BUILD/fuzz/$target.log" || true
done

if [ ${#failed[@]} -gt 0 ]; then
  echo "fuzz: crashed: ${failed[*]}; inputs in $BUILD/fuzz/crashes/" >&2
  exit 1
fi
echo "fuzz: no crash in ${TARGETS[*]}"
