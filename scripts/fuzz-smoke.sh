#!/usr/bin/env bash
# Builds every libFuzzer target (tests/fuzz/*_fuzz.cpp) with clang into build-fuzz/, the
# library instrumented as well, then runs each for a short while. Exits non-zero when a
# target fails to build or finds a crash; the crashing input is kept in build-fuzz/artifacts.
# FUZZ_SECONDS sets the run time per target (default 30). Each target starts from the inputs
# it found before (build-fuzz/corpus/<target>, written to) and from the seeds kept in the
# repository (tests/fuzz/corpus/<target>, only read).
set -euo pipefail
cd "$(dirname "$0")/.."

dir="${KESU_FUZZ_BUILD_DIR:-build-fuzz}"
seconds="${FUZZ_SECONDS:-30}"

targets=()
for src in tests/fuzz/*_fuzz.cpp; do
  [ -e "$src" ] || continue
  targets+=("$(basename "$src" .cpp)")
done
if [ ${#targets[@]} -eq 0 ]; then
  echo "fuzz-smoke: no fuzz targets"
  exit 0
fi

# The compiler is fixed when the build folder is first configured.
CXX="${KESU_FUZZ_CXX:-clang++}" \
KESU_BUILD_DIR="$dir" \
KESU_SANITIZE="fuzzer-no-link,address,undefined" \
KESU_CMAKE_ARGS="-DKESU_BUILD_FUZZ=ON -DKESU_BUILD_TESTS=OFF -DKESU_BUILD_BENCH=OFF" \
  ./scripts/build.sh -j"${FUZZ_JOBS:-2}" "${targets[@]}"

# Whatever the code under test logs goes to a throw-away home, never the user's.
scratch="$(mktemp -d)"
trap 'rm -rf "$scratch"' EXIT
mkdir -p "$dir/artifacts"
export ASAN_OPTIONS="${ASAN_OPTIONS:-detect_leaks=1:abort_on_error=1}"
export UBSAN_OPTIONS="${UBSAN_OPTIONS:-print_stacktrace=1:halt_on_error=1}"

failed=()
for t in "${targets[@]}"; do
  corpus="$dir/corpus/$t"
  mkdir -p "$corpus"
  seeds=()
  [ -d "tests/fuzz/corpus/$t" ] && seeds=("tests/fuzz/corpus/$t")
  echo "== fuzz $t (${seconds}s)"
  if ! HOME="$scratch/home" KESU_ROOT="$scratch/root" \
      "$dir/tests/fuzz/$t" -max_total_time="$seconds" -print_final_stats=1 \
      -artifact_prefix="$dir/artifacts/$t-" "$corpus" "${seeds[@]}" >"$dir/$t.log" 2>&1; then
    tail -n 60 "$dir/$t.log"
    failed+=("$t")
  else
    tail -n 12 "$dir/$t.log"
  fi
done

if [ ${#failed[@]} -gt 0 ]; then
  echo "fuzz-smoke: FAILED: ${failed[*]}"
  exit 1
fi
echo "fuzz-smoke: all ${#targets[@]} target(s) ran clean"
