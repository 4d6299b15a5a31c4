#!/usr/bin/env bash
# Packet rate through sluice-host on veth pairs: 64-byte UDP frames from a
# generator in the "vm" namespace to the "net" namespace, with no rules,
# 1,000 exact rules and 1,000 general rules, next to the same traffic
# forwarded by a kernel bridge (the interface pair's own limit). Prints
# frames per second delivered and the share of sluice-host's busy time
# spent inside the filter. Needs root.
#
#   scripts/live-bench.sh [SECONDS]
set -euo pipefail
cd "$(dirname "$0")/.."
if [ "$(id -u)" -ne 0 ]; then
  echo "live-bench: needs root (network namespaces)" >&2
  exit 1
fi
SECS=${1:-5}
. scripts/live-topology.sh
topo_build sluice-host sluice-ctl udp-blast

P=bench$$
DIR=$(mktemp -d /tmp/sluice-bench.XXXXXX)
SOCK=$DIR/ctl.sock
HOST_PID=""
stop_host() {
  if [ -n "$HOST_PID" ]; then
    kill -TERM "$HOST_PID" 2>/dev/null || true
    wait "$HOST_PID" 2>/dev/null || true
    HOST_PID=""
  fi
}
cleanup() { stop_host; topo_down "$P"; rm -rf "$DIR"; }
trap cleanup EXIT
topo_up "$P"

rx() { ip netns exec "$P-net" cat /sys/class/net/eth0/statistics/rx_packets; }
# Blasts for SECS seconds; prints "sent delivered" frames per second.
blast() {
  local before after sent
  before=$(rx)
  sent=$(ip netns exec "$P-vm" "$BLAST" eth0 02:00:00:00:77:01 02:00:00:00:77:02 \
    10.77.0.1 10.77.0.2 9000 1000 "$SECS")
  sleep 0.5
  after=$(rx)
  echo "$((sent / SECS)) $(((after - before) / SECS))"
}
start_host() {
  ip netns exec "$P-fp" "$HOST" --socket "$SOCK" --max-seconds 300 \
    --agent 'bench:default-action=ACTION_ACCEPT' \
    --port name=vm1.eth0,agent=bench,vm=vmside,switch=swside 2>/dev/null &
  HOST_PID=$!
  for _ in $(seq 50); do "$CTL" --socket "$SOCK" hello >/dev/null 2>&1 && break; sleep 0.1; done
}
# The share of the port's busy time spent in the filter, and busy and
# filter nanoseconds per frame read from the VM side.
share() {
  "$CTL" --socket "$SOCK" --json stats | python3 -c '
import json, sys
t = json.load(sys.stdin)["ports"][0]["traffic"]
busy, mod, n = t["busyNs"], t["moduleNs"], max(1, t["rxFromVm"])
print("%.1f%% %d %d %d %.1f" % (100.0 * mod / max(1, busy), busy / n, mod / n, t["txNs"] / n,
                              n / max(1, t["batches"])))'
}
report() { printf '%-28s %10s %12s %7s %8s %8s %8s %6s\n' "$@"; }
# One case through sluice-host: NAME, then a rules file (none: no rules).
measure() {
  local s d sh busy mod tx batch
  start_host
  [ -z "${2:-}" ] || "$CTL" --socket "$SOCK" ruleset set vm1.eth0 "$2" >/dev/null
  read -r s d < <(blast)
  read -r sh busy mod tx batch < <(share)
  report "$1" "$s" "$d" "$sh" "$busy" "$mod" "$tx" "$batch"
  stop_host
}

report "case" "sent/s" "delivered/s" "filter" "busy ns" "filt ns" "send ns" "batch"
# Kernel bridge between the two sides: what the veth pairs carry unfiltered.
ip -n "$P-fp" link add br0 type bridge
ip -n "$P-fp" link set vmside master br0
ip -n "$P-fp" link set swside master br0
ip -n "$P-fp" link set br0 up
read -r s d < <(blast)
report "kernel bridge (no filter)" "$s" "$d" "-" "-" "-" "-" "-"
ip -n "$P-fp" link del br0

measure "sluice-host, no rules"

{
  echo "ruleset version=8"
  for f in $(seq 0 999); do
    echo "action=accept dmac=02:00:00:00:77:02 smac=02:00:00:00:77:01 ethtype=0x0800 vlan=none ipv4 proto=udp sa=10.77.0.1 da=10.77.0.2 sport=$((10000 + f)) dport=9000"
  done
} >"$DIR/exact.rules"
measure "sluice-host, 1000 exact" "$DIR/exact.rules"

{
  echo "ruleset version=8"
  for i in $(seq 0 998); do
    echo "action=drop ipv4 proto=udp sport=$((30000 + 2 * i))-$((30001 + 2 * i))"
  done
  echo "action=accept ipv4 proto=udp dport=9000-9001"
} >"$DIR/general.rules"
measure "sluice-host, 1000 general" "$DIR/general.rules"
