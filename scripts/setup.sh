#!/usr/bin/env bash
# Installs what building and testing TarnMessaging needs on a Debian machine.
# As root it installs the missing packages with apt-get; otherwise it prints
# the exact command to run. Safe to run again: it only installs what is absent.
#
# Required packages stop the build when missing. Optional ones each enable one
# piece, which the build skips with a message when the package is absent; as
# root they are installed too.
set -euo pipefail

required=(cmake make g++ libboost-dev libgtest-dev)
optional=(
  libbenchmark-dev  # the benchmarks
  pkg-config        # finds glib-2.0 for the GLib event-loop integration
  libglib2.0-dev    # the GLib event-loop integration, its example and its tests
  doxygen           # the API reference: the docs target and the docs_build test
  clang-tidy        # the lint target
  clang             # the fuzzer (libFuzzer) and the clang++ header check
  libsigc++-3.0-dev # more peer rows in the benchmarks
  qtbase5-dev       # the Qt event-loop integration, its example and tests; Qt rows in the benchmarks
  python3           # the benchmark report (bench/report.py)
  gnuplot-nox       # the benchmark chart
  time              # make compile-time (GNU time's CPU seconds)
  libzmq3-dev       # the remote library (stations across processes), its tests and its fuzz target; with:
  cppzmq-dev        #   the C++ binding of libzmq, for the remote library
  libmsgpack-cxx-dev #  the remote library's wire codec (MessagePack)
  libsystemd-dev    # sd-bus: the D-Bus comparison for the remote library's benchmark rows
)

installed() {
  dpkg-query -W -f='${Status}' "$1" 2>/dev/null | grep -q "install ok installed"
}

missing_required=()
missing_optional=()
for pkg in "${required[@]}"; do
  installed "$pkg" || missing_required+=("$pkg")
done
for pkg in "${optional[@]}"; do
  installed "$pkg" || missing_optional+=("$pkg")
done
missing=("${missing_required[@]}" "${missing_optional[@]}")

if [ ${#missing[@]} -eq 0 ]; then
  echo "setup: every package is installed"
  exit 0
fi

echo "setup: missing packages: ${missing[*]}"
if [ "$(id -u)" -ne 0 ]; then
  if [ ${#missing_required[@]} -eq 0 ]; then
    echo "setup: only optional packages are missing; the pieces that need them are skipped." >&2
    echo "setup: to have them, run as root:  apt-get update && apt-get install -y ${missing[*]}" >&2
    exit 0
  fi
  echo "setup: run as root:  apt-get update && apt-get install -y ${missing[*]}" >&2
  exit 1
fi
export DEBIAN_FRONTEND=noninteractive
apt-get update
apt-get install -y --no-install-recommends "${missing[@]}"
echo "setup: done"
