#!/usr/bin/env bash
# Configures and builds into $KESU_BUILD_DIR (default build/); KESU_SANITIZE picks sanitizers.
# Arguments: target names (default: everything) and cmake --build options such as -j2.
set -euo pipefail
cd "$(dirname "$0")/.."
dir="${KESU_BUILD_DIR:-build}"
cmake -S . -B "$dir" -G Ninja -DKESU_SANITIZE="${KESU_SANITIZE:-}" ${KESU_CMAKE_ARGS:-} >/dev/null
args=()
for a in "$@"; do
  case "$a" in
    -*) args+=("$a") ;;
    *) args+=(--target "$a") ;;
  esac
done
cmake --build "$dir" "${args[@]}"
