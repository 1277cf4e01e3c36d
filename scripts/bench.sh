#!/usr/bin/env bash
# Builds and runs the benchmarks (release build, no sanitizers).
#   KESU_BENCH_QUICK=1     short runs of every benchmark (a smoke check: the figures are noisy)
#   KESU_BENCH_NO_BUILD=1  run the benchmarks already built in $KESU_BUILD_DIR
set -euo pipefail
cd "$(dirname "$0")/.."
dir="${KESU_BUILD_DIR:-build-bench}"
if [ -z "${KESU_BENCH_NO_BUILD:-}" ]; then
  ./scripts/setup.sh
  KESU_BUILD_DIR="$dir" KESU_CMAKE_ARGS="-DCMAKE_BUILD_TYPE=Release -DKESU_BUILD_TESTS=OFF" ./scripts/build.sh
fi
quick_args() {
  case "$1" in
    connect_bench) echo "30 5" ;;
    connectflow_bench) echo "--trips=40" ;;
    control_bench) echo "200 1" ;;
    idle_bench) echo "--seconds=2 --settle=1" ;;
    preconnect_bench) echo "--seconds=10 --settle=3 --trips=50" ;;
    runtime_bench) echo "2" ;;
    ssdp_bench) echo "--benchmark_min_time=0.01" ;;
  esac
}
for b in "$dir"/bench/*_bench; do
  name="$(basename "$b")"
  echo "== $name"
  if [ -n "${KESU_BENCH_QUICK:-}" ]; then
    # shellcheck disable=SC2046
    "$b" $(quick_args "$name")
  else
    "$b"
  fi
done
