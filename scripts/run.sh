#!/usr/bin/env bash
# Installs what is needed, builds, and runs the service in the foreground.
set -euo pipefail
cd "$(dirname "$0")/.."
./scripts/setup.sh
KESU_BUILD_DIR="${KESU_BUILD_DIR:-build}" ./scripts/build.sh KesuConnService
exec "${KESU_BUILD_DIR:-build}/KesuConnService"
