#!/usr/bin/env bash
# Installs the Debian packages the build needs, when they are missing.
# Runs apt-get only as root; otherwise it says what is missing and fails.
#   scripts/install-deps.sh [fuzz]   (fuzz: also clang and its fuzzer runtime)
set -euo pipefail

need=()
have_cmd() { command -v "$1" >/dev/null 2>&1; }
have_pkg() { dpkg-query -W -f='${Status}' "$1" 2>/dev/null | grep -q "install ok installed"; }

have_cmd cmake || need+=(cmake)
have_cmd ninja || need+=(ninja-build)
have_cmd g++ || need+=(g++)
have_pkg libgtest-dev || need+=(libgtest-dev)
have_pkg libgmock-dev || need+=(libgmock-dev)
have_pkg libbenchmark-dev || need+=(libbenchmark-dev)
have_cmd valgrind || need+=(valgrind)
if [ "${1:-}" = fuzz ]; then
  have_cmd clang++ || need+=(clang)
  have_pkg libclang-rt-dev || need+=(libclang-rt-dev)
fi

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
