#!/usr/bin/env bash
# Configures and builds into $KESU_BUILD_DIR (default build/); KESU_SANITIZE picks sanitizers.
set -euo pipefail
cd "$(dirname "$0")/.."
dir="${KESU_BUILD_DIR:-build}"
cmake -S . -B "$dir" -G Ninja -DKESU_SANITIZE="${KESU_SANITIZE:-}" ${KESU_CMAKE_ARGS:-} >/dev/null
cmake --build "$dir" "$@"
