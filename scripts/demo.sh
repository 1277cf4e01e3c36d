#!/usr/bin/env bash
# Try the service on one machine: the service in one network namespace ("the PC") and a
# simulated phone in another, joined by a veth pair (10.77.0.1 and 10.77.0.2). Shows the phone
# appearing in `kesuctl devices`, then connects to it with `kesuctl connect`, the phone
# accepting. Everything it makes (namespaces, processes, a temporary HOME) is removed at the
# end, also when a step fails. Needs root (network namespaces); exits 77 without it.
#
# Builds KesuConnService, kesuctl and phone_simulator first (scripts/build.sh, into
# $KESU_BUILD_DIR, default build/) unless KESU_DEMO_NO_BUILD=1.
set -euo pipefail
cd "$(dirname "$0")/.."

if [ "$(id -u)" -ne 0 ]; then
  echo "demo: needs root to make network namespaces; run: sudo ./scripts/demo.sh" >&2
  exit 77
fi

dir="${KESU_BUILD_DIR:-build}"
if [ "${KESU_DEMO_NO_BUILD:-0}" != 1 ]; then
  ./scripts/build.sh KesuConnService kesuctl phone_simulator >/dev/null
fi
for bin in KesuConnService kesuctl phone_simulator; do
  if [ ! -x "$dir/$bin" ]; then
    echo "demo: $dir/$bin is missing; build it: ./scripts/build.sh KesuConnService kesuctl phone_simulator" >&2
    exit 1
  fi
done
dir="$(cd "$dir" && pwd)"

pc=kesudemo-pc
phone=kesudemo-phone
pc_ip=10.77.0.1
phone_ip=10.77.0.2
work="$(mktemp -d /tmp/kesu-demo.XXXXXX)"
service_pid=""
sim_pid=""

# Ends a process we started: SIGTERM, up to 10 s to go, then SIGKILL.
stop_process() {
  local pid="$1"
  [ -n "$pid" ] && kill -0 "$pid" 2>/dev/null || return 0
  kill -TERM "$pid" 2>/dev/null || true
  timeout 10 tail --pid="$pid" -f /dev/null || kill -KILL "$pid" 2>/dev/null || true
  wait "$pid" 2>/dev/null || true
}

cleanup() {
  trap '' INT TERM  # a second Ctrl-C must not cut the clean-up short
  stop_process "$sim_pid"
  stop_process "$service_pid"
  ip netns del "$pc" 2>/dev/null || true
  ip netns del "$phone" 2>/dev/null || true
  rm -rf "$work"
}
trap cleanup EXIT
trap 'exit 130' INT TERM

fail() {
  echo "demo: FAILED: $*" >&2
  echo "--- last lines of the service's output:" >&2
  tail -n 20 "$work/service.log" >&2 || true
  echo "--- last lines of the phone simulator's output:" >&2
  tail -n 10 "$work/phone.log" >&2 || true
  exit 1
}

step() { printf '\n== %s\n' "$*"; }

# kesuctl as a user on the PC would run it.
ctl() { ip netns exec "$pc" "$dir/kesuctl" "$@"; }

step "network: $pc ($pc_ip) <-veth-> $phone ($phone_ip)"
ip netns del "$pc" 2>/dev/null || true
ip netns del "$phone" 2>/dev/null || true
ip netns add "$pc"
ip netns add "$phone"
ip -n "$pc" link add veth0 type veth peer name veth0 netns "$phone"
for node in "$pc:$pc_ip" "$phone:$phone_ip"; do
  ns="${node%%:*}"
  ip -n "$ns" link set lo up
  ip -n "$ns" addr add "${node#*:}/24" dev veth0
  ip -n "$ns" link set veth0 up
  ip -n "$ns" route add 224.0.0.0/4 dev veth0
done

step "start the service in $pc (HOME and KESU_ROOT below $work)"
mkdir -p "$work/home" "$work/root"
# Its own PID namespace too, so that a service already running on this machine does not
# count as another instance.
HOME="$work/home" KESU_ROOT="$work/root" ip netns exec "$pc" \
  unshare --pid --fork --mount-proc --kill-child=SIGTERM "$dir/KesuConnService" >"$work/service.log" 2>&1 &
service_pid=$!
alive=""
for _ in $(seq 1 40); do
  if alive="$(ctl --timeout 2 heartbeat 2>&1)"; then break; fi
  alive=""
  kill -0 "$service_pid" 2>/dev/null || fail "the service ended at start-up"
  sleep 0.25
done
[ -n "$alive" ] || fail "the service did not answer a heartbeat within about 20 s"
echo "\$ kesuctl heartbeat"
echo "$alive"

step "start a simulated phone in $phone: announces itself every second, accepts connections"
ip netns exec "$phone" "$dir/phone_simulator" --iface-ip "$phone_ip" --announce-every 1 \
  --tcp-port 10191 --answer accept --duration 120 >"$work/phone.log" 2>&1 &
sim_pid=$!

step "wait for the phone in the service's device list"
listing=""
id=""
for _ in $(seq 1 40); do
  listing="$(ctl --timeout 5 devices 2>&1)" || fail "kesuctl devices: $listing"
  id="$(awk -v ip="$phone_ip" '$0 ~ ip { print $1; exit }' <<<"$listing")"
  [ -n "$id" ] && break
  kill -0 "$sim_pid" 2>/dev/null || fail "the phone simulator ended"
  sleep 0.5
done
echo "\$ kesuctl devices"
echo "$listing"
[ -n "$id" ] || fail "the phone did not appear within about 20 s"

step "connect to the phone"
echo "\$ kesuctl connect $id"
connect_rc=0
ctl connect "$id" || connect_rc=$?
[ "$connect_rc" -eq 0 ] || fail "kesuctl connect $id exited with $connect_rc"
# The simulator logs the request before it answers, so the line is there by now.
grep -q 'SIM TCP_REQUEST' "$work/phone.log" || fail "the phone logged no connection request"
echo "phone side: got the PC's connection request and accepted it"

step "done: the phone was found and connected; cleaning up"
