#!/usr/bin/env bash
# The README's run command, `./scripts/run.sh`, run as a user types it from the repository:
# the service it builds and starts must answer HeartBeat on the control API and stop cleanly
# (exit code 0) on SIGTERM. It runs with a scratch HOME, in a network namespace of its own
# (loopback only: nothing is announced on the LAN) and in a PID namespace of its own (a copy
# running on the machine would make it stand down). The namespace goes in every case.
# KESU_RUN_CHECK_TIMEOUT bounds set-up, build and start together (seconds, default 1800).
set -euo pipefail
cd "$(dirname "$0")/.."

limit="${KESU_RUN_CHECK_TIMEOUT:-1800}"
ns="kesu-runcheck"
scratch="$(mktemp -d /tmp/kesu-runcheck-XXXXXX)"
log="$scratch/run.log"
launcher=""
cleanup() {
  # unshare --kill-child takes the whole PID namespace with it.
  if [ -n "$launcher" ] && kill -0 "$launcher" 2>/dev/null; then
    kill -KILL "$launcher" 2>/dev/null || true
    wait "$launcher" 2>/dev/null || true
  fi
  ip netns del "$ns" 2>/dev/null || true
  rm -rf "$scratch"
}
trap cleanup EXIT
fail() {
  echo "FAIL: $*" >&2
  echo "--- last lines of the run's output:" >&2
  tail -n 40 "$log" >&2 || true
  exit 1
}

# Packages first, with the network at hand (inside, only loopback exists); the compiler cache
# stays the user's, not the scratch HOME's.
./scripts/setup.sh >/dev/null
if command -v ccache >/dev/null; then export CCACHE_DIR="${CCACHE_DIR:-$(ccache -k cache_dir)}"; fi

ip netns del "$ns" 2>/dev/null || true
ip netns add "$ns"
ip -n "$ns" link set lo up
mkdir "$scratch/home"
mkfifo "$scratch/out"
HOME="$scratch/home" ip netns exec "$ns" unshare --pid --fork --mount-proc --kill-child \
  ./scripts/run.sh >"$scratch/out" 2>&1 &
launcher=$!
exec 3<"$scratch/out"

# Copies the run's output, line by line as it comes, to the log until a line holds $1 (0),
# the output ends (1: the service and unshare have exited) or $2 seconds pass (2).
follow() {
  local deadline=$((SECONDS + $2)) line rc
  while [ $SECONDS -lt $deadline ]; do
    if IFS= read -r -t $((deadline - SECONDS)) line <&3; then
      printf '%s\n' "$line" >>"$log"
      [ -n "$1" ] && [[ "$line" == *"$1"* ]] && return 0
    else
      rc=$?
      [ $rc -gt 128 ] && return 2
      [ -n "$line" ] && printf '%s\n' "$line" >>"$log"
      return 1
    fi
  done
  return 2
}

rc=0
follow "[httpService]Run succ" "$limit" || rc=$?
[ $rc -eq 0 ] || fail "the service did not report '[httpService]Run succ' ($([ $rc -eq 1 ] && echo "the run ended" || echo "${limit}s passed"))"

json='{"event":"HeartBeat","args":[]}'
answer="$(ip netns exec "$ns" curl -s -m 10 -H 'Content-Type: text/plain' \
  --data-binary "${#json}#$json" http://127.0.0.1:9197/ || true)"
python3 -c 'import json,sys; a=sys.argv[1]; j=json.loads(a[a.index("#")+1:]); sys.exit(j.get("data")!="Alive" or j.get("error")!=0)' \
  "$answer" 2>/dev/null || fail "HeartBeat answered '$answer'"
echo "HeartBeat: $answer"

# The service is the child of unshare (the first process of the new PID namespace).
service="$(cat "/proc/$launcher/task/$launcher/children")"
[[ "$service" =~ ^[0-9]+\ ?$ ]] || fail "no single service process below unshare: '$service'"
kill -TERM $service
rc=0
follow "" 30 || rc=$?
[ $rc -eq 1 ] || fail "still running 30s after SIGTERM"
code=0
wait "$launcher" || code=$?
launcher=""
[ "$code" -eq 0 ] || fail "exit code $code after SIGTERM"
grep -qF "[服务启动] stopped" "$log" || fail "no '[服务启动] stopped' in the output"
echo "check-run-command: ./scripts/run.sh built and started the service; HeartBeat answered; SIGTERM stopped it with exit code 0"
