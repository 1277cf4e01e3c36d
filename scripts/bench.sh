#!/usr/bin/env bash
# Builds and runs the benchmarks (release build, no sanitizers).
set -euo pipefail
cd "$(dirname "$0")/.."
./scripts/setup.sh
dir="${KESU_BUILD_DIR:-build-bench}"
KESU_BUILD_DIR="$dir" KESU_CMAKE_ARGS="-DCMAKE_BUILD_TYPE=Release -DKESU_BUILD_TESTS=OFF" ./scripts/build.sh
for b in "$dir"/bench/*_bench; do
  echo "== $(basename "$b")"
  "$b"
done
