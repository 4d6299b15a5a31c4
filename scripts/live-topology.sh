# Network namespaces for running sluice-host on live traffic; sourced by
# scripts/live-demo.sh and the service tests.
#
#   topo_up P     makes namespaces P-vm, P-net, P-fp and P-gre:
#                   P-vm  eth0 10.77.0.1/24 ── vmside ┐
#                                                      P-fp (sluice-host)
#                   P-net eth0 10.77.0.2/24 ── swside ┘   g0 10.78.0.1/24
#                   P-gre g1 10.78.0.2/24 ──────────────── g0
#                 sluice-host runs in P-fp with a port between vmside
#                 (VM side) and swside (switch side); GRE copies for
#                 10.78.0.2 reach P-gre through P-fp's routing.
#   topo_down P   removes them (safe to call more than once).
#   topo_require TOOL...
#                 for tests: exits 77 (skipped) with the reason unless
#                 running as root with every TOOL installed.
#   topo_build TARGET...
#                 for the scripts: installs what the project needs and
#                 builds TARGETs (tools preset); HOST, CTL and BLAST name
#                 sluice-host, sluice-ctl and udp-blast there.
#
# Helpers for the tests that drive traffic through it:
#   topo_check NAME COMMAND...       runs COMMAND, prints ok/FAIL NAME and
#                                    sets FAILED=1 when it fails
#   topo_wait_for FILE PATTERN [N]   waits up to 5 s for N (default 1)
#                                    lines matching PATTERN in FILE
#   topo_json EXPR                   prints the Python expression EXPR of
#                                    the JSON document d on standard input
#   topo_send_udp NS ADDR PORT COUNT [BYTES] [GAP]
#                                    sends COUNT one-line datagrams of BYTES
#                                    (default 16) from namespace NS, GAP
#                                    seconds apart (default 0.002)
#   topo_recv_udp NS PORT SECONDS FILE
#                                    receives datagrams on PORT in NS into
#                                    FILE, one a line, in the background;
#                                    LAST_RECV is the receiver's pid
#
# Senders have checksum and segmentation offload turned off so every frame
# read from an interface is complete.

topo_build() {
  bash scripts/install-deps.sh
  cmake --preset tools >/dev/null
  cmake --build --preset tools -j 2 --target "$@" >/dev/null
  HOST=build/tools/service/sluice-host
  CTL=build/tools/service/sluice-ctl
  BLAST=build/tools/service/udp-blast
}

topo_require() {
  if [ "$(id -u)" -ne 0 ]; then
    echo "SKIP: needs root to make network namespaces"
    exit 77
  fi
  local tool
  for tool in "$@"; do
    if ! command -v "$tool" >/dev/null 2>&1; then
      echo "SKIP: $tool is not installed (scripts/install-deps.sh installs it)"
      exit 77
    fi
  done
}

topo_down() {
  local p=$1 ns
  for ns in vm net fp gre; do
    ip netns del "$p-$ns" 2>/dev/null || true
  done
}

topo_up() {
  local p=$1 ns
  topo_down "$p"
  for ns in vm net fp gre; do ip netns add "$p-$ns" || return 1; done
  ip -n "$p-fp" link add vmside type veth peer name eth0 netns "$p-vm" || return 1
  ip -n "$p-fp" link add swside type veth peer name eth0 netns "$p-net" || return 1
  ip -n "$p-fp" link add g0 type veth peer name g1 netns "$p-gre" || return 1
  ip -n "$p-vm" addr add 10.77.0.1/24 dev eth0
  ip -n "$p-net" addr add 10.77.0.2/24 dev eth0
  ip -n "$p-fp" addr add 10.78.0.1/24 dev g0
  ip -n "$p-gre" addr add 10.78.0.2/24 dev g1
  for ns in vm net fp gre; do ip -n "$p-$ns" link set lo up; done
  ip -n "$p-vm" link set eth0 address 02:00:00:00:77:01
  ip -n "$p-net" link set eth0 address 02:00:00:00:77:02
  ip -n "$p-vm" link set eth0 up
  ip -n "$p-net" link set eth0 up
  ip -n "$p-fp" link set vmside up
  ip -n "$p-fp" link set swside up
  ip -n "$p-fp" link set g0 up
  ip -n "$p-gre" link set g1 up
  # IPv6 autoconfiguration would put stray frames on the wire.
  for ns in vm net fp gre; do
    ip netns exec "$p-$ns" sysctl -qw net.ipv6.conf.all.disable_ipv6=1 2>/dev/null || true
  done
  if command -v ethtool >/dev/null 2>&1; then
    ip netns exec "$p-vm" ethtool -K eth0 tx off tso off gso off >/dev/null 2>&1
    ip netns exec "$p-net" ethtool -K eth0 tx off tso off gso off >/dev/null 2>&1
  fi
  return 0
}

topo_check() {
  local name=$1
  shift
  if "$@"; then echo "ok   $name"; else echo "FAIL $name"; FAILED=1; fi
}

topo_wait_for() {
  local i
  for i in $(seq 50); do
    [ "$(grep -c -- "$2" "$1" 2>/dev/null)" -ge "${3:-1}" ] && return 0
    sleep 0.1
  done
  return 1
}

topo_json() {
  python3 -c 'import json, sys; d = json.load(sys.stdin); print(eval(sys.argv[1]))' "$1"
}

topo_send_udp() {
  ip netns exec "$1" python3 -c '
import socket, sys, time
s = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
line = b"x" * int(sys.argv[4]) + b"\n"
for i in range(int(sys.argv[3])):
    s.sendto(line, (sys.argv[1], int(sys.argv[2])))
    time.sleep(float(sys.argv[5]))' "$2" "$3" "$4" "${5:-16}" "${6:-0.002}"
}

# Started through ip directly (not a subshell) so that $! is the receiver
# and killing it ends it.
topo_recv_udp() {
  ip netns exec "$1" timeout "$3" socat -u "UDP-RECV:$2" - >"$4" 2>/dev/null &
  LAST_RECV=$!
}
