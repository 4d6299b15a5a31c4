#!/usr/bin/env bash
# Installs the Debian packages the build needs, when they are missing.
# Runs apt-get only as root; otherwise it says what is missing and fails.
#   scripts/install-deps.sh          the build, the tools and the tests
#   scripts/install-deps.sh bench    also the peer classifier and the plot
#   scripts/install-deps.sh fuzz     also clang and its fuzzer runtime
set -euo pipefail

need=()
have_cmd() { command -v "$1" >/dev/null 2>&1; }
have_pkg() { dpkg-query -W -f='${Status}' "$1" 2>/dev/null | grep -q "install ok installed"; }

# The build and the tests.
have_cmd cmake || need+=(cmake)
have_cmd ninja || need+=(ninja-build)
have_cmd g++ || need+=(g++)
have_cmd pkg-config || need+=(pkg-config)
have_pkg libgtest-dev || need+=(libgtest-dev)
have_pkg libgmock-dev || need+=(libgmock-dev)
have_pkg libbenchmark-dev || need+=(libbenchmark-dev)
have_cmd valgrind || need+=(valgrind)
# The tools and the long-running host: captures, command lines, text, JSON.
have_pkg libpcap-dev || need+=(libpcap-dev)
have_pkg libcli11-dev || need+=(libcli11-dev)
have_pkg libfmt-dev || need+=(libfmt-dev)
have_pkg nlohmann-json3-dev || need+=(nlohmann-json3-dev)
# The live-traffic tests and demo: namespaces, veth, traffic, captures.
have_cmd ip || need+=(iproute2)
have_cmd ping || need+=(iputils-ping)
have_cmd ethtool || need+=(ethtool)
have_cmd socat || need+=(socat)
have_cmd tcpdump || need+=(tcpdump)
have_cmd python3 || need+=(python3)
# sluice-slowpath writes its captures with libpcap.
have_pkg libpcap-dev || need+=(libpcap-dev)
have_cmd pkg-config || need+=(pkg-config)

case "${1:-}" in
  bench)
    have_pkg libdpdk-dev || need+=(libdpdk-dev)
    have_pkg python3-matplotlib || need+=(python3-matplotlib)
    ;;
  fuzz)
    have_cmd clang++ || need+=(clang)
    have_pkg libclang-rt-dev || need+=(libclang-rt-dev)
    ;;
  "") ;;
  *) echo "install-deps.sh: unknown set '$1' (bench, fuzz)" >&2; exit 2 ;;
esac

if [ ${#need[@]} -eq 0 ]; then
  exit 0
fi
if [ "$(id -u)" -ne 0 ]; then
  echo "missing packages: ${need[*]} (run as root to install them)" >&2
  exit 1
fi
export DEBIAN_FRONTEND=noninteractive
apt-get update -qq
apt-get install -y -qq --no-install-recommends "${need[@]}"
