#!/usr/bin/env bash
# Configures and builds into $KESU_BUILD_DIR (default build/); KESU_SANITIZE picks sanitizers.
# Arguments: target names (default: everything) and cmake --build options such as -j2 or
# --target NAME (an option's separate value, as in `-j 2` or `--target NAME`, goes with it).
set -euo pipefail
cd "$(dirname "$0")/.."
dir="${KESU_BUILD_DIR:-build}"
cmake -S . -B "$dir" -G Ninja -DKESU_SANITIZE="${KESU_SANITIZE:-}" ${KESU_CMAKE_ARGS:-} >/dev/null
args=()
while [ $# -gt 0 ]; do
  case "$1" in
    --target|-t|--config|--parallel|-j)
      args+=("$1")
      # -j and --parallel may stand alone; their value is a number.
      if [ $# -gt 1 ] && { [[ "$1" != -j && "$1" != --parallel ]] || [[ "$2" =~ ^[0-9]+$ ]]; }; then
        args+=("$2")
        shift
      fi
      ;;
    -*) args+=("$1") ;;
    *) args+=(--target "$1") ;;
  esac
  shift
done
cmake --build "$dir" "${args[@]}"
