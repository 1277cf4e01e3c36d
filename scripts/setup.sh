#!/usr/bin/env bash
# Installs every Debian package the build, the tests and the benchmarks need.
# Idempotent: packages already present are left alone.
set -euo pipefail

packages=(
  build-essential cmake ninja-build ccache pkg-config clang
  libasio-dev libcpp-httplib-dev libssl-dev zlib1g-dev libbrotli-dev
  nlohmann-json3-dev libspdlog-dev libfmt-dev libsqlite3-dev sqlite3 libutf8proc-dev
  googletest libgtest-dev libgmock-dev libbenchmark-dev
  iproute2 procps iputils-ping curl python3 util-linux systemd
)

missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done

if [ ${#missing[@]} -gt 0 ]; then
  SUDO=""
  [ "$(id -u)" -ne 0 ] && SUDO="sudo"
  export DEBIAN_FRONTEND=noninteractive
  $SUDO apt-get update -qq
  $SUDO apt-get install -y -qq --no-install-recommends "${missing[@]}"
fi
echo "setup: all packages present"
