#!/usr/bin/env bash
# The filter on live traffic, end to end: makes namespaces "vm" and "net"
# joined through sluice-host (and "gre" for mirrored copies), loads a
# ruleset with sluice-ctl, sends ping, TCP and UDP from the VM, and prints
# the status tree with each rule's counters. Everything is removed on exit.
# Needs root.
#
#   scripts/live-demo.sh [RULES_FILE]
set -euo pipefail
cd "$(dirname "$0")/.."
if [ "$(id -u)" -ne 0 ]; then
  echo "live-demo: needs root (network namespaces)" >&2
  exit 1
fi
. scripts/live-topology.sh
topo_build sluice-host sluice-ctl

P=demo$$
DIR=$(mktemp -d /tmp/sluice-demo.XXXXXX)
SOCK=$DIR/ctl.sock
HOST_PID=""
cleanup() {
  [ -n "$HOST_PID" ] && kill -TERM "$HOST_PID" 2>/dev/null && wait "$HOST_PID" 2>/dev/null
  topo_down "$P"
  rm -rf "$DIR"
}
trap cleanup EXIT

RULES=${1:-}
if [ -z "$RULES" ]; then
  RULES=$DIR/demo.rules
  cat >"$RULES" <<'RULES'
ruleset version=8
# the VM's web server: TCP 8080 in, replies out
action=accept ipv4 proto=tcp dport=8080
action=accept ipv4 proto=tcp sport=8080
# DNS-like UDP is marked with DSCP 46 on its way out
action=dscp dscp=46 ipv4 proto=udp dport=53
# everything for UDP 9999 is copied, cut to 96 bytes, to the collector
action=gre gre=10.78.0.2 snaplen=96 ipv4 proto=udp dport=9999
# no ping, no telnet
action=drop ipv4 proto=icmp
action=drop ipv4 proto=tcp dport=23
RULES
fi

echo "== namespaces $P-vm (10.77.0.1) and $P-net (10.77.0.2), sluice-host in $P-fp"
topo_up "$P"
ip netns exec "$P-fp" "$HOST" --socket "$SOCK" --max-seconds 120 \
  --agent 'demo:default-action=ACTION_ACCEPT' \
  --port name=vm1.eth0,agent=demo,vm=vmside,switch=swside,uuid=564d-demo-vm1,vnic=0 &
HOST_PID=$!
for _ in $(seq 50); do "$CTL" --socket "$SOCK" hello >/dev/null 2>&1 && break; sleep 0.1; done

echo "== loading $RULES"
"$CTL" --socket "$SOCK" ruleset set vm1.eth0 "$RULES"
"$CTL" --socket "$SOCK" ruleset get vm1.eth0

in_ns() { ip netns exec "$P-$1" "${@:2}"; }
echo "== traffic"
in_ns vm ping -c 3 -i 0.2 -W 1 -q 10.77.0.2 >/dev/null && echo "ping: answered" || echo "ping: dropped"
in_ns net timeout 3 socat -u TCP-LISTEN:8080,reuseaddr - >"$DIR/web" 2>/dev/null &
in_ns net timeout 3 socat -u TCP-LISTEN:23,reuseaddr - >"$DIR/telnet" 2>/dev/null &
in_ns gre timeout 3 tcpdump --immediate-mode -i g1 -U -w "$DIR/gre.pcap" proto gre 2>/dev/null &
sleep 0.5
echo "GET /" | in_ns vm timeout 2 socat -u - TCP:10.77.0.2:8080,connect-timeout=1 2>/dev/null || true
echo "login" | in_ns vm timeout 2 socat -u - TCP:10.77.0.2:23,connect-timeout=1 2>/dev/null || true
for i in 1 2 3 4 5; do echo "query $i" | in_ns vm socat -u - UDP-SENDTO:10.77.0.2:53; done
for i in 1 2 3; do echo "mirror me $i" | in_ns vm socat -u - UDP-SENDTO:10.77.0.2:9999; done
wait $(jobs -p | grep -v "^$HOST_PID$") 2>/dev/null || true
echo "tcp 8080: $( [ -s "$DIR/web" ] && echo delivered || echo not delivered)"
echo "tcp 23:   $( [ -s "$DIR/telnet" ] && echo delivered || echo not delivered)"
echo "GRE copies at the collector: $(tcpdump -r "$DIR/gre.pcap" -nn 2>/dev/null | wc -l)"

echo "== status tree"
"$CTL" --socket "$SOCK" status --agent demo
echo "== host"
"$CTL" --socket "$SOCK" stats
