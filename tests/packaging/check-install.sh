#!/usr/bin/env bash
# `cmake --install` into a scratch prefix: the service, every tool of tools/ and the systemd
# user unit land there, the unit's ExecStart names the installed binary, and systemd-analyze
# finds nothing to say about the unit (checked offline on the file: no systemd needs to run).
# Arguments: build dir, source dir, bin dir and unit dir (both relative to the prefix).
set -euo pipefail
build="$1" src="$2" bindir="$3" unitdir="$4"
scratch="$(mktemp -d /tmp/kesu-install-XXXXXX)"
trap 'rm -rf "$scratch"' EXIT
prefix="$scratch/prefix"
fail() { echo "FAIL: $*" >&2; exit 1; }

cmake --install "$build" --prefix "$prefix" >"$scratch/install.log" 2>&1 || { cat "$scratch/install.log"; fail "cmake --install"; }
for program in KesuConnService $(find "$src/tools" -maxdepth 1 -name '*.cpp' -printf '%f\n' | sed 's/\.cpp$//'); do
  [ -x "$prefix/$bindir/$program" ] || fail "$program is not installed in $prefix/$bindir"
done
unit="$prefix/$unitdir/kesu-conn.service"
[ -f "$unit" ] || fail "no unit at $unit"
grep -qx "ExecStart=$prefix/$bindir/KesuConnService" "$unit" ||
  fail "ExecStart does not name the installed binary: $(grep ExecStart "$unit")"

if ! command -v systemd-analyze >/dev/null; then
  echo "*** SKIPPED: systemd-analyze is missing (package systemd): the unit was not verified ***"
  exit 77
fi
mkdir -p "$scratch/run"
# Parse warnings ("... ignoring") leave the exit code 0: any output counts as a failure.
if ! XDG_RUNTIME_DIR="$scratch/run" systemd-analyze verify --user "$unit" >"$scratch/verify.log" 2>&1 ||
   [ -s "$scratch/verify.log" ]; then
  cat "$scratch/verify.log"
  fail "systemd-analyze verify --user $unit"
fi
echo "installed and verified: $(cd "$prefix" && find . -type f | sort | tr '\n' ' ')"
