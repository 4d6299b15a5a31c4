#!/usr/bin/env bash
# sluice-host on live traffic: namespaces "vm" and "net" joined through
# sluice-host, rules loaded and changed with sluice-ctl while traffic flows,
# GRE copies captured in a third namespace, DSCP marks and L2 rewrite seen
# on the wire, the device channel, hostile rulesets, ports coming and going.
# Verdicts and counters of accepted, dropped and punted traffic are checked
# by slowpath_test.sh. Needs root; exits 77 (skipped) otherwise.
#
#   live_test.sh SLUICE_HOST SLUICE_CTL
set -u
HOST_BIN=$1
CTL_BIN=$2
HERE=$(cd "$(dirname "$0")/../.." && pwd)

. "$HERE/scripts/live-topology.sh"
topo_require ip ping tcpdump timeout python3
P="slt$$"
DIR=$(mktemp -d /tmp/sluice-live.XXXXXX)
SOCK="$DIR/ctl.sock"
HOST_PID=""
FAILED=0

cleanup() {
  if [ -n "$HOST_PID" ] && kill -0 "$HOST_PID" 2>/dev/null; then
    kill -KILL "$HOST_PID" 2>/dev/null
  fi
  topo_down "$P"
  [ -n "${KEEP_DIR:-}" ] || rm -rf "$DIR"
}
trap cleanup EXIT
trap 'exit 1' INT TERM

ctl() { timeout 10 "$CTL_BIN" --socket "$SOCK" "$@"; }
check() { topo_check "$@"; }
in_ns() { local ns=$1; shift; ip netns exec "$P-$ns" "$@"; }
set_rules() { printf '%s\n' "$@" | ctl ruleset set vm1.eth0 - >/dev/null; }
send_udp() { local ns=$1; shift; topo_send_udp "$P-$ns" "$@"; }
heap() { ctl --json stats | topo_json 'd["heapBytes"]'; }

topo_up "$P" || { echo "FAIL could not make namespaces"; exit 1; }
# Started directly (not through a function) so that $! is the host itself.
ip netns exec "$P-fp" "$HOST_BIN" --socket "$SOCK" --gre kernel --max-seconds 80 \
  --agent 'fw:default-action=ACTION_ACCEPT' \
  --port name=vm1.eth0,agent=fw,vm=vmside,switch=swside,uuid=564d-live,vnic=3 \
  2>"$DIR/host.log" &
HOST_PID=$!
for _ in $(seq 50); do ctl hello >/dev/null 2>&1 && break; sleep 0.1; done
check "host answers" ctl hello
HEAP0=$(heap)

# --- rules changed while traffic flows lose no accepted packet ----------------
topo_recv_udp "$P-net" 5200 30 "$DIR/u5200"; sleep 0.3
( send_udp vm 10.77.0.2 5200 150 16 0.01 ) &
SENDER=$!
for i in $(seq 15); do
  set_rules "action=accept ipv4 proto=udp dport=5200" "action=drop ipv4 proto=udp dport=$((6100 + i))"
  set_rules "action=drop ipv4 proto=tcp dport=$((6200 + i))" "action=accept ipv4 proto=udp dport=5200"
done
wait $SENDER; sleep 0.5; kill $LAST_RECV 2>/dev/null; wait $LAST_RECV 2>/dev/null
check "no accepted datagram lost across 30 rule changes" test "$(wc -l <"$DIR/u5200")" -eq 150

# --- GRE mirror captured in a third namespace ---------------------------------
set_rules "action=gre gre=10.78.0.2 snaplen=64 ipv4 proto=udp dport=5300" \
  "action=dscp dscp=46 ipv4 proto=udp dport=5400" \
  "action=l2rewrite rewrite=02:00:00:00:77:99 ipv4 proto=udp dport=5500"
ip netns exec "$P-gre" timeout 10 tcpdump --immediate-mode -i g1 -U -w "$DIR/gre.pcap" proto gre 2>"$DIR/c1.err" &
C1=$!
ip netns exec "$P-net" timeout 10 tcpdump --immediate-mode -i eth0 -U -w "$DIR/net.pcap" udp 2>"$DIR/c2.err" &
C2=$!
# Capturing starts when tcpdump says it is listening.
for _ in $(seq 50); do
  grep -q listening "$DIR/c1.err" && grep -q listening "$DIR/c2.err" && break
  sleep 0.1
done
send_udp vm 10.77.0.2 5300 4 300
send_udp vm 10.77.0.2 5400 3
send_udp net 10.77.0.1 5500 3
sleep 1  # frames still in the filter's receive ring, copies still in flight
kill -INT $C1 $C2 2>/dev/null; wait $C1 $C2 2>/dev/null
GRE_COUNT=$(tcpdump -r "$DIR/gre.pcap" -nn 2>/dev/null | wc -l)
check "4 GRE copies captured" test "$GRE_COUNT" -eq 4
# Outer IPv4 (20) + GRE (4) + the mirrored frame cut at 64 bytes.
check "GRE copies carry the frame cut at the snap length" \
  bash -c "tcpdump -r '$DIR/gre.pcap' -nn -v 2>/dev/null | grep -c 'length 88' | grep -qx 4"
check "DSCP mark on the wire with a valid IPv4 checksum" \
  bash -c "tcpdump -r '$DIR/net.pcap' -nn -v 'udp dst port 5400' 2>/dev/null | grep 'tos 0xb8' | grep -vc 'bad cksum' | grep -qx 3"
check "L2 rewrite turns frames back toward the switch with the new MAC" \
  bash -c "tcpdump -r '$DIR/net.pcap' -nn -e 'ether dst 02:00:00:00:77:99 and udp dst port 5500' 2>/dev/null | wc -l | grep -qx 3"

# --- the device channel, by name and by VM UUID --------------------------------
printf 'action=drop ipv4 proto=udp dport=5600\n' >"$DIR/dev.rules"
check "device set by uuid and vnic" ctl dev set --uuid 564d-live --vnic 3 "$DIR/dev.rules"
check "device get by name shows it" bash -c "'$CTL_BIN' --socket '$SOCK' dev get --filter vm1.eth0 | grep -q 'dport=5600'"
check "device test ioctl" ctl dev test --filter vm1.eth0

# --- hostile rulesets on a live filter: refused, host up, heap unchanged -------
HEAP1=$(heap)
ctl ruleset get vm1.eth0 --wire "$DIR/good.bin"
python3 - "$DIR" <<'PY'
import struct, sys
d = sys.argv[1]
good = open(d + "/good.bin", "rb").read()
# header claims far more rules than follow; a header cut short; random bytes
open(d + "/many.bin", "wb").write(good[:3] + struct.pack("<I", 0xFFFFFFFF) + good[7:])
open(d + "/short.bin", "wb").write(good[:9])
import random
random.seed(9)
open(d + "/noise.bin", "wb").write(bytes(random.randrange(256) for _ in range(700)))
PY
for f in many short noise; do
  check "property refuses a $f ruleset" bash -c "! '$CTL_BIN' --socket '$SOCK' ruleset set vm1.eth0 --wire '$DIR/$f.bin' 2>/dev/null"
  check "device refuses a $f ruleset" bash -c "! '$CTL_BIN' --socket '$SOCK' dev set --filter vm1.eth0 --wire '$DIR/$f.bin' 2>/dev/null"
done
check "the rules in force survive hostile rulesets" bash -c "'$CTL_BIN' --socket '$SOCK' ruleset get vm1.eth0 | grep -q 'dport=5600'"
HEAP2=$(heap)
check "heap unchanged by hostile rulesets ($HEAP1 -> $HEAP2)" test "$HEAP1" = "$HEAP2"

# --- ports come and go while the host runs --------------------------------------
check "remove the port" ctl remove-port vm1.eth0
check "ping fails with no port" bash -c "! ip netns exec $P-vm ping -c 1 -W 1 -q 10.77.0.2"
check "add it back" ctl add-port name=vm1.eth0,agent=fw,vm=vmside,switch=swside
check "ping passes through the new filter" in_ns vm ping -c 2 -i 0.2 -W 1 -q 10.77.0.2

# --- clean stop ------------------------------------------------------------------
kill -TERM "$HOST_PID"
wait "$HOST_PID"; RC=$?
HOST_PID=""
check "host exits 0 on SIGTERM with nothing left behind" test "$RC" -eq 0
[ "$RC" -eq 0 ] || cat "$DIR/host.log"
echo "heap at start: $HEAP0 bytes"
exit $FAILED
