#!/usr/bin/env bash
# Installs what building and testing TarnMessaging needs on a Debian machine.
# As root it installs the missing packages with apt-get; otherwise it prints
# the exact command to run. Safe to run again: it only installs what is absent.
set -euo pipefail

required=(cmake make g++ libboost-dev libgtest-dev)
optional=(libbenchmark-dev)   # the benchmarks are skipped without it

missing=()
for pkg in "${required[@]}" "${optional[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$pkg" 2>/dev/null | grep -q "install ok installed"; then
    missing+=("$pkg")
  fi
done

if [ ${#missing[@]} -eq 0 ]; then
  echo "setup: every package is installed"
  exit 0
fi

echo "setup: missing packages: ${missing[*]}"
if [ "$(id -u)" -ne 0 ]; then
  echo "setup: run as root:  apt-get update && apt-get install -y ${missing[*]}" >&2
  exit 1
fi
export DEBIAN_FRONTEND=noninteractive
apt-get update
apt-get install -y --no-install-recommends "${missing[@]}"
echo "setup: done"
