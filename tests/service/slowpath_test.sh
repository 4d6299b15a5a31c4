#!/usr/bin/env bash
# sluice-host on live traffic, a real slow path, and a filter migrating
# between two sluice-host processes.
#
# Two copies of the live topology (scripts/live-topology.sh), each with its
# own sluice-host: A in $P-fp, B in $Q-fp, with the same addresses, so that
# the "VM" behind B stands for the VM once it has moved. Slow paths are
# sluice-slowpath processes fed commands through a FIFO. Before any slow
# path, A's port carries live traffic: rules changed with sluice-ctl while
# it flows, GRE copies captured in $P-gre, DSCP marks and L2 rewrites seen
# on the wire, the device channel, hostile rulesets. Ports are removed from
# and added to running hosts, and pass traffic, in the migration part.
#
#   slowpath_test.sh SLUICE_HOST SLUICE_CTL SLUICE_SLOWPATH
#
# Needs root; exits 77 (skipped) otherwise.
set -u
HOST_BIN=$1
CTL_BIN=$2
SP_BIN=$3
HERE=$(cd "$(dirname "$0")/../.." && pwd)

. "$HERE/scripts/live-topology.sh"
topo_require ip socat timeout python3 tcpdump
P="ssa$$"
Q="ssb$$"
DIR=$(mktemp -d /tmp/sluice-sp.XXXXXX)
PIDS=()
FAILED=0

cleanup() {
  local pid
  for pid in "${PIDS[@]}"; do kill -KILL "$pid" 2>/dev/null; done
  wait 2>/dev/null
  topo_down "$P"
  topo_down "$Q"
  rm -rf "$DIR"
}
trap cleanup EXIT
trap 'exit 1' INT TERM

ctl() { local sock=$1; shift; timeout 20 "$CTL_BIN" --socket "$DIR/$sock.sock" "$@"; }
check() { topo_check "$@"; }
wait_for() { topo_wait_for "$@"; }
send_udp() { topo_send_udp "$1" "$2" "$3" "$4" 16 "${5:-0.002}"; }
lines() { wc -l <"$1" | tr -d ' '; }
# Starts a slow path with commands from a FIFO: start_sp NAME HOST [OPTIONS...]
start_sp() {
  local name=$1 host=$2; shift 2
  mkfifo "$DIR/$name.in"
  "$SP_BIN" --socket "$DIR/$host.sock" --agent fw --name "$name" "$@" \
    <>"$DIR/$name.in" >"$DIR/$name.out" 2>"$DIR/$name.err" &
  eval "SP_$name=$!"
  PIDS+=($!)
}
sp_cmd() { echo "$2" >"$DIR/$1.in"; }
# Packet counters of the rules of host HOST's port, space separated.
rule_counts() {
  ctl "$1" --json status --agent fw | topo_json \
    '" ".join(str(r["packets"]) for r in d["agents"][0]["filters"][0]["counters"]["rules"]) if d["agents"][0]["filters"] else "none"'
}
ports_of() { ctl "$1" --json stats | topo_json '" ".join(p["name"] for p in d["ports"]) or "none"'; }
slowpaths_of() {
  ctl "$1" --json stats |
    topo_json '" ".join(s["name"] + ":" + ",".join(s["filters"]) for s in d["slowPaths"]) or "none"'
}
heap_of() { ctl "$1" --json stats | topo_json 'd["heapBytes"]'; }
# One round of traffic from the VM in namespace prefix PFX: 4 datagrams to
# an accepted port, 3 to a dropped one, 5 to a punted one (sent back by the
# slow path), then a marker; the receiver stops once the marker and the 5
# punted datagrams are in (at most 2 s after the marker) and prints what
# arrived on each port.
traffic_round() {  # traffic_round PFX
  local pfx=$1 r
  rm -f "$DIR/ready"
  ip netns exec "$pfx-net" timeout 15 python3 -c '
import select, socket, sys, time
socks = {}
for port in (5200, 5400, 5300, 5999):
    s = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
    s.bind(("0.0.0.0", port))
    socks[s] = port
open(sys.argv[1], "w").close()
got = {5200: 0, 5400: 0, 5300: 0}
marker = False
end = time.time() + 10
while time.time() < end:
    ready, _, _ = select.select(list(socks), [], [], 0.05)
    for s in ready:
        s.recv(2048)
        port = socks[s]
        if port == 5999:
            marker = True
            end = min(end, time.time() + 2)
        else:
            got[port] += 1
    # Punted datagrams come back through the slow path after the marker;
    # once all have, there is nothing left to wait for.
    if marker and got[5300] >= 5:
        break
print(got[5200], got[5400], got[5300])' "$DIR/ready" >"$DIR/round" &
  r=$!
  for _ in $(seq 100); do [ -e "$DIR/ready" ] && break; sleep 0.05; done
  ip netns exec "$pfx-vm" python3 -c '
import socket, time
s = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
for port, n in ((5200, 4), (5400, 3), (5300, 5), (5999, 1)):
    for i in range(n):
        s.sendto(b"d%d\n" % i, ("10.77.0.2", port))
        time.sleep(0.002)'
  wait $r
  cat "$DIR/round"
}

cat >"$DIR/rules.txt" <<'EOF'
action=accept ipv4 proto=udp dport=5200
action=drop ipv4 proto=udp dport=5400
action=punt ipv4 proto=udp dport=5300
EOF

topo_up "$P" && topo_up "$Q" || { echo "FAIL could not make namespaces"; exit 1; }
ip netns exec "$P-fp" "$HOST_BIN" --socket "$DIR/A.sock" --gre kernel --max-seconds 100 \
  --agent 'fw:default-action=ACTION_ACCEPT' \
  --port name=vm1,agent=fw,vm=vmside,switch=swside,uuid=564d-mig,vnic=1 2>"$DIR/A.log" &
HOST_A=$!
PIDS+=($!)
ip netns exec "$Q-fp" "$HOST_BIN" --socket "$DIR/B.sock" --gre memory --max-seconds 100 \
  --agent 'fw:default-action=ACTION_ACCEPT' 2>"$DIR/B.log" &
HOST_B=$!
PIDS+=($!)
for _ in $(seq 50); do ctl A hello >/dev/null 2>&1 && ctl B hello >/dev/null 2>&1 && break; sleep 0.1; done
hello_both() { ctl A hello >/dev/null && ctl B hello >/dev/null; }
check "both hosts answer" hello_both
HEAP_B0=$(heap_of B)

# --- live traffic on A: rules changed while it flows lose no accepted packet --
set_rules() { printf '%s\n' "$@" | ctl A ruleset set vm1 - >/dev/null; }
topo_recv_udp "$P-net" 5200 30 "$DIR/u5200"; sleep 0.3
( send_udp "$P-vm" 10.77.0.2 5200 150 0.01 ) &
SENDER=$!
for i in $(seq 15); do
  set_rules "action=accept ipv4 proto=udp dport=5200" "action=drop ipv4 proto=udp dport=$((6100 + i))"
  set_rules "action=drop ipv4 proto=tcp dport=$((6200 + i))" "action=accept ipv4 proto=udp dport=5200"
done
wait $SENDER; sleep 0.5; kill $LAST_RECV 2>/dev/null; wait $LAST_RECV 2>/dev/null
check "no accepted datagram lost across 30 rule changes" test "$(lines "$DIR/u5200")" -eq 150

# GRE copies captured in a third namespace, marks and rewrites on the wire.
set_rules "action=gre gre=10.78.0.2 snaplen=64 ipv4 proto=udp dport=5300" \
  "action=dscp dscp=46 ipv4 proto=udp dport=5400" \
  "action=l2rewrite rewrite=02:00:00:00:77:99 ipv4 proto=udp dport=5500"
ip netns exec "$P-gre" timeout 10 tcpdump --immediate-mode -i g1 -U -w "$DIR/gre.pcap" proto gre 2>"$DIR/c1.err" &
C1=$!
ip netns exec "$P-net" timeout 10 tcpdump --immediate-mode -i eth0 -U -w "$DIR/net.pcap" udp 2>"$DIR/c2.err" &
C2=$!
for _ in $(seq 50); do  # capturing starts when tcpdump says it is listening
  grep -q listening "$DIR/c1.err" && grep -q listening "$DIR/c2.err" && break
  sleep 0.1
done
topo_send_udp "$P-vm" 10.77.0.2 5300 4 300
send_udp "$P-vm" 10.77.0.2 5400 3
send_udp "$P-net" 10.77.0.1 5500 3
sleep 1  # frames still in the filter's receive ring, copies still in flight
kill -INT $C1 $C2 2>/dev/null; wait $C1 $C2 2>/dev/null
check "4 GRE copies captured" test "$(tcpdump -r "$DIR/gre.pcap" -nn 2>/dev/null | wc -l)" -eq 4
# Outer IPv4 (20) + GRE (4) + the mirrored frame cut at 64 bytes.
check "GRE copies carry the frame cut at the snap length" \
  bash -c "tcpdump -r '$DIR/gre.pcap' -nn -v 2>/dev/null | grep -c 'length 88' | grep -qx 4"
check "DSCP mark on the wire with a valid IPv4 checksum" \
  bash -c "tcpdump -r '$DIR/net.pcap' -nn -v 'udp dst port 5400' 2>/dev/null | grep 'tos 0xb8' | grep -vc 'bad cksum' | grep -qx 3"
check "L2 rewrite turns frames back toward the switch with the new MAC" \
  bash -c "tcpdump -r '$DIR/net.pcap' -nn -e 'ether dst 02:00:00:00:77:99 and udp dst port 5500' 2>/dev/null | wc -l | grep -qx 3"

# The device channel, by name and by VM UUID.
printf 'action=drop ipv4 proto=udp dport=5600\n' >"$DIR/dev.rules"
check "device set by uuid and vnic" ctl A dev set --uuid 564d-mig --vnic 1 "$DIR/dev.rules"
check "device get by name shows it" bash -c "'$CTL_BIN' --socket '$DIR/A.sock' dev get --filter vm1 | grep -q 'dport=5600'"
check "device test ioctl" ctl A dev test --filter vm1

# Hostile rulesets on a live filter: refused, host up, heap unchanged.
HEAP_A1=$(heap_of A)
ctl A ruleset get vm1 --wire "$DIR/good.bin"
python3 - "$DIR" <<'PY'
import random, struct, sys
d = sys.argv[1]
good = open(d + "/good.bin", "rb").read()
# header claims far more rules than follow; a header cut short; random bytes
open(d + "/many.bin", "wb").write(good[:3] + struct.pack("<I", 0xFFFFFFFF) + good[7:])
open(d + "/short.bin", "wb").write(good[:9])
random.seed(9)
open(d + "/noise.bin", "wb").write(bytes(random.randrange(256) for _ in range(700)))
PY
for f in many short noise; do
  check "property refuses a $f ruleset" bash -c "! '$CTL_BIN' --socket '$DIR/A.sock' ruleset set vm1 --wire '$DIR/$f.bin' 2>/dev/null"
  check "device refuses a $f ruleset" bash -c "! '$CTL_BIN' --socket '$DIR/A.sock' dev set --filter vm1 --wire '$DIR/$f.bin' 2>/dev/null"
done
check "the rules in force survive hostile rulesets" bash -c "'$CTL_BIN' --socket '$DIR/A.sock' ruleset get vm1 | grep -q 'dport=5600'"
check "heap unchanged by hostile rulesets" test "$HEAP_A1" = "$(heap_of A)"

# --- register, receive, answer, push ------------------------------------------
start_sp a1 A --print --reissue --pcap "$DIR/a1.pcap"
check "slow path registers and its filter attaches" wait_for "$DIR/a1.out" "attached vm1"
sp_cmd a1 "push vm1 $DIR/rules.txt"
check "ruleset pushed over the filter-ioctl channel" wait_for "$DIR/a1.out" "push vm1 status=1"
sp_cmd a1 "echo vm1 ab1z"
check "echo over the filter-ioctl channel" wait_for "$DIR/a1.out" "echo vm1 AB1Z"
check "verdicts: 4 accepted, 3 dropped, 5 punted and sent back" \
  test "$(traffic_round "$P")" = "4 0 5"
check "the slow path received the 5 punted packets" \
  test "$(grep -c "packet vm1 dir=2" "$DIR/a1.out")" -eq 5
check "the slow path's capture holds them" \
  test "$(tcpdump -nr "$DIR/a1.pcap" 2>/dev/null | grep -c 'UDP')" -eq 5
sp_cmd a1 "rules vm1"
check "rules read back over the filter-ioctl channel" wait_for "$DIR/a1.out" "rules vm1 rules=3"
check "rule counters equal what was sent" test "$(rule_counts A)" = "4 3 5"
stats_show_link() { ctl A stats | grep -q "slow path #1 a1 (agent fw): filters \[vm1\], punted 5 (dropped 0), sent back 5"; }
check "stats show the link and what passed over it" stats_show_link

# A copy goes to the slow path while the original goes on; this slow path
# sends its copy back too.
echo "action=copy ipv4 proto=udp dport=5200" >"$DIR/copy.txt"
sp_cmd a1 "push vm1 $DIR/copy.txt"
check "copy rule pushed" wait_for "$DIR/a1.out" "push vm1 status=1" 2
topo_recv_udp "$P-net" 5200 20 "$DIR/c5200"; C1=$LAST_RECV
sleep 0.3
send_udp "$P-vm" 10.77.0.2 5200 3
sleep 0.5
kill $C1 2>/dev/null; wait $C1 2>/dev/null
check "copies reach the slow path" test "$(grep -c "packet vm1 dir=2" "$DIR/a1.out")" -eq 8
check "originals and returned copies arrive" test "$(lines "$DIR/c5200")" -eq 6
sp_cmd a1 "push vm1 $DIR/rules.txt"
check "rules pushed back" wait_for "$DIR/a1.out" "push vm1 status=1" 3

# --- killing a slow path mid-stream loses nothing the rules accept ------------
start_sp a2 A --reissue
check "a second slow path registers" wait_for "$DIR/a2.out" "registered"
topo_recv_udp "$P-net" 5200 20 "$DIR/k5200"; K1=$LAST_RECV
sleep 0.3
( send_udp "$P-vm" 10.77.0.2 5200 300 0.004 ) &
S1=$!
( send_udp "$P-vm" 10.77.0.2 5300 300 0.004 ) &
S2=$!
sleep 0.5
{ kill -KILL "$SP_a1"; wait "$SP_a1"; } 2>/dev/null
wait $S1 $S2
sleep 0.5
kill $K1 2>/dev/null; wait $K1 2>/dev/null
check "all 300 accepted datagrams arrived across the kill" test "$(lines "$DIR/k5200")" -eq 300
check "the filter moved to the remaining slow path" wait_for "$DIR/a2.out" "attached vm1"
check "host survives and unregistered the killed one" test "$(slowpaths_of A)" = "a2:vm1"
check "host log says the slow path went away" grep -q "went away" "$DIR/A.log"
sp_cmd a2 "clear vm1"
sp_cmd a2 "rules vm1"
check "rules cleared over the filter-ioctl channel" wait_for "$DIR/a2.out" "rules vm1 rules=0"
sp_cmd a2 "push vm1 $DIR/rules.txt"
check "and pushed again" wait_for "$DIR/a2.out" "push vm1 status=1"
check "verdicts unchanged with the new slow path" test "$(traffic_round "$P")" = "4 0 5"

# --- migration A -> B: verdicts, counters and slow path state -----------------
start_sp b1 B --reissue
check "destination slow path registers" wait_for "$DIR/b1.out" "registered"
BEFORE=$(rule_counts A)
check "counters started over with the pushed rules" test "$BEFORE" = "4 3 5"
sp_cmd a2 counts
wait_for "$DIR/a2.out" "counts-end"
SP_BEFORE=$(sed -n 's/^counts vm1 .*to-switch=\([0-9]*\) .*/\1/p' "$DIR/a2.out" | tail -1)
check "migrate vm1 from A to B" ctl A migrate vm1 --to "$DIR/B.sock"
check "source fetched its slow path's state" wait_for "$DIR/a2.out" "fetched vm1"
check "destination slow path got the state" wait_for "$DIR/b1.out" "restored vm1"
FETCHED=$(sed -n 's/^fetched vm1 .*state=//p' "$DIR/a2.out" | tail -1)
RESTORED=$(sed -n 's/^restored vm1 .*state=//p' "$DIR/b1.out" | tail -1)
check "slow path state round-trips byte for byte" test -n "$FETCHED" -a "$FETCHED" = "$RESTORED"
check "port left A" test "$(ports_of A)" = "none"
check "port is on B, attached to B's slow path" test "$(slowpaths_of B)" = "b1:vm1"
check "counters arrived unchanged" test "$(rule_counts B)" = "$BEFORE"
check "verdicts identical through B" test "$(traffic_round "$Q")" = "4 0 5"
read -r c0 c1 c2 <<<"$BEFORE"
check "counters continue from A's" test "$(rule_counts B)" = "$((c0 + 4)) $((c1 + 3)) $((c2 + 5))"
sp_cmd b1 counts
check "B's slow path counts continue from A's" \
  wait_for "$DIR/b1.out" "counts vm1 from-switch=0 to-switch=$((SP_BEFORE + 5)) "

# --- a slow path that does not answer the fetch --------------------------------
kill -STOP "$SP_b1"
ctl B migrate vm1 --to "$DIR/A.sock" >"$DIR/m0.out" 2>&1
M0=$?
kill -CONT "$SP_b1"
check "a silent slow path fails the migration after its time-out" \
  test $M0 -ne 0 -a "$(ports_of B)" = "vm1"
check "the refusal says the state was not saved" grep -q "saved-state length: 0xbad0001" "$DIR/m0.out"
check "the port carries on at the source" test "$(traffic_round "$Q")" = "4 0 5"

# --- a restore whose slow path part cannot be delivered -----------------------
kill -TERM "$SP_a2"; wait "$SP_a2" 2>/dev/null
for _ in $(seq 30); do [ "$(slowpaths_of A)" = "none" ] && break; sleep 0.1; done
check "failure policy 0, no slow path there: migration refused" \
  bash -c "! timeout 20 '$CTL_BIN' --socket '$DIR/B.sock' migrate vm1 --to '$DIR/A.sock' 2>'$DIR/m.err'"
check "the refusal names the module's status" grep -q "0xbad0001\|failure" "$DIR/m.err"
check "the port stays on B and passes traffic" test "$(ports_of B) $(traffic_round "$Q")" = "vm1 4 0 5"

start_sp a3 A --reissue --refuse-restore
check "a refusing slow path registers" wait_for "$DIR/a3.out" "registered"
ctl B migrate vm1 --to "$DIR/A.sock" >"$DIR/m.out" 2>&1
check "slow path refusing the restore: rules restored anyway" grep -q "slow path state failed" "$DIR/m.out"
check "the refusing slow path was asked" wait_for "$DIR/a3.out" "restore-refused vm1"
check "verdicts identical through A again" test "$(traffic_round "$P")" = "4 0 5"

# Failure policy 1 lets the filter go without its slow path's part.
ctl A remove-port vm1 >/dev/null
ctl A add-port name=vm1,agent=fw,vm=vmside,switch=swside,uuid=564d-mig,vnic=1,failure=1 >/dev/null
check "policy-1 port attaches" wait_for "$DIR/a3.out" "attached vm1"
printf '%s\n' "action=accept ipv4 proto=udp dport=5200" "action=drop ipv4 proto=udp dport=5400" \
  "action=punt ipv4 proto=udp dport=5300" | ctl A ruleset set vm1 - >/dev/null
traffic_round "$P" >/dev/null
sp_cmd b1 quit
for _ in $(seq 30); do [ "$(slowpaths_of B)" = "none" ] && break; sleep 0.1; done
ctl A migrate vm1 --to "$DIR/B.sock" >"$DIR/m2.out" 2>&1
check "failure policy 1, no slow path there: migrated, slow path part dropped" \
  grep -q "slow path state dropped" "$DIR/m2.out"
# Punted packets with no slow path pass under policy 1.
check "verdicts through B without a slow path" test "$(traffic_round "$Q")" = "4 0 5"
check "counters continued" test "$(rule_counts B)" = "8 6 10"

# --- a clean stop: nothing left behind -----------------------------------------
ctl B remove-port vm1 >/dev/null
check "B's heap back where it started" test "$(heap_of B)" = "$HEAP_B0"
kill -TERM "$HOST_B"
wait "$HOST_B"
check "B stops cleanly (exit 0: nothing left behind)" test $? -eq 0
# A still has a port and a slow path connected to it.
kill -TERM "$HOST_A"
wait "$HOST_A"
check "A stops cleanly with a slow path still connected" test $? -eq 0
check "A's slow path saw the link close" wait_for "$DIR/a3.err" "link to the host closed"

if [ $FAILED -ne 0 ]; then
  for f in "$DIR"/*.log "$DIR"/*.out "$DIR"/*.err; do
    echo "--- $f"; tail -n 30 "$f"
  done
fi
exit $FAILED
