#!/usr/bin/env bash
# Installs a build into a scratch prefix and builds and runs a small consumer
# (examples/consumer) against it the two ways the README documents:
#   1. find_package(TarnMessaging) in a CMake project, with the event-loop
#      examples linked to each integration the build has (its components),
#      and the remote example where the build has Tarn::Remote;
#   2. pkg-config, as C++17 with LD_LIBRARY_PATH and as C++20 with an rpath
#      (the .pc files must leave the language level to the consumer), and each
#      event-loop example through its integration's .pc file.
# Each consumer must load the libraries of the prefix, not of the build tree.
#
#   scripts/check-install.sh BUILD_DIR [WORK_DIR]
#
# Run by ctest (the install_consumer test). Exits non-zero on the first step
# that fails, naming it.
set -euo pipefail

[ $# -ge 1 ] || { echo "usage: $0 BUILD_DIR [WORK_DIR]" >&2; exit 2; }
source_dir=$(cd "$(dirname "$0")/.." && pwd)
build_dir=$(cd "$1" && pwd)
work=${2:-$build_dir/consumer-check}
prefix=$work/prefix
consumer=$source_dir/examples/consumer
CXX=${CXX:-c++}

step() { echo "check-install: $*"; }
fail() { echo "check-install: FAILED: $*" >&2; exit 1; }

rm -rf "$work"
mkdir -p "$work"
step "install into $prefix"
cmake --install "$build_dir" --prefix "$prefix" > "$work/install.log" || fail "cmake --install (see $work/install.log)"
libdir=$(dirname "$(find "$prefix" -name 'libTarnMessaging.so*' -print -quit)")
[ -d "$libdir" ] || fail "no libTarnMessaging.so under $prefix"

# The consumer must have resolved libTarnMessaging to the prefix.
uses_prefix() {
  local loaded
  loaded=$(ldd "$1") || fail "ldd $1"
  grep -q "libTarnMessaging.so.* => $libdir/" <<< "$loaded" || fail "$1 does not load libTarnMessaging from $libdir"
}

# The integrations this build installed, each a component of the package:
# the consumer requires every one of them.
loops=()
components=()
for targets in "$libdir"/cmake/TarnMessaging/Tarn*IntegrationTargets.cmake; do
  [ -e "$targets" ] || continue
  component=$(basename "$targets" Targets.cmake)
  component=${component#Tarn}
  components+=("$component")
  loop=${component%Integration}
  loops+=("${loop,,}")
done
[ ${#components[@]} -gt 0 ] || fail "no integration installed under $libdir/cmake/TarnMessaging"
# The remote library, where it was built: its example runs both routes too.
remote=0
required=("${components[@]}")
if [ -e "$libdir/cmake/TarnMessaging/TarnRemoteTargets.cmake" ]; then
  remote=1
  required+=(Remote)
fi

step "find_package route (components: ${required[*]})"
cmake -S "$consumer" -B "$work/cmake-build" -DCMAKE_PREFIX_PATH="$prefix" -DCMAKE_BUILD_TYPE=Release \
  -DCMAKE_FIND_PACKAGE_NO_PACKAGE_REGISTRY=ON "-DTARN_COMPONENTS=$(IFS=';'; echo "${required[*]}")" \
  -DTARN_LOOP_EXAMPLES="$source_dir/examples" > "$work/cmake.log" || fail "configuring the consumer (see $work/cmake.log)"
cmake --build "$work/cmake-build" -j 2 >> "$work/cmake.log" || fail "building the consumer (see $work/cmake.log)"
uses_prefix "$work/cmake-build/tarn-consumer"
"$work/cmake-build/tarn-consumer" || fail "the find_package consumer"
for loop in "${loops[@]}"; do
  uses_prefix "$work/cmake-build/tarn-$loop-loop"
  "$work/cmake-build/tarn-$loop-loop" > "$work/$loop-loop.log" || fail "the find_package $loop example (see $work/$loop-loop.log)"
done
if [ "$remote" -eq 1 ]; then
  uses_prefix "$work/cmake-build/tarn-remote-pair"
  "$work/cmake-build/tarn-remote-pair" > "$work/remote-pair.log" || fail "the find_package remote example (see $work/remote-pair.log)"
fi

step "pkg-config route"
export PKG_CONFIG_PATH=$libdir/pkgconfig
cflags=$(pkg-config --cflags TarnMessaging) || fail "pkg-config --cflags TarnMessaging"
libs=$(pkg-config --libs TarnMessaging) || fail "pkg-config --libs TarnMessaging"
case " $cflags " in *" -std="*) fail "pkg-config --cflags forces a language level: $cflags" ;; esac
[ "$(pkg-config --variable=libdir TarnMessaging)" = "$libdir" ] || fail "the .pc file's libdir is not $libdir"
# shellcheck disable=SC2086 # the flags are word lists
"$CXX" -std=c++17 $cflags "$consumer/main.cpp" -o "$work/consumer-env" $libs -pthread || fail "building with pkg-config (C++17)"
LD_LIBRARY_PATH=$libdir uses_prefix "$work/consumer-env"
LD_LIBRARY_PATH=$libdir "$work/consumer-env" || fail "the pkg-config consumer with LD_LIBRARY_PATH"
# shellcheck disable=SC2086
"$CXX" -std=c++20 $cflags "$consumer/main.cpp" -o "$work/consumer-rpath" $libs -pthread -Wl,-rpath,"$libdir" ||
  fail "building with pkg-config (C++20, rpath)"
uses_prefix "$work/consumer-rpath"
"$work/consumer-rpath" || fail "the pkg-config consumer with an rpath"
for i in "${!loops[@]}"; do
  loop=${loops[$i]}
  pc=Tarn${components[$i]}
  # -fPIC: Debian's Qt refuses code built without it.
  # shellcheck disable=SC2046 # the flags are word lists
  "$CXX" -std=c++17 -fPIC "$source_dir/examples/${loop}_loop.cpp" -o "$work/$loop-loop-pc" \
    $(pkg-config --cflags --libs "$pc") -pthread -Wl,-rpath,"$libdir" || fail "building the $loop example with pkg-config ($pc)"
  uses_prefix "$work/$loop-loop-pc"
  "$work/$loop-loop-pc" > "$work/$loop-loop-pc.log" || fail "the pkg-config $loop example (see $work/$loop-loop-pc.log)"
done
if [ "$remote" -eq 1 ]; then
  # shellcheck disable=SC2046
  "$CXX" -std=c++17 "$source_dir/examples/remote_pair.cpp" -o "$work/remote-pair-pc" \
    $(pkg-config --cflags --libs TarnRemote) -pthread -Wl,-rpath,"$libdir" || fail "building the remote example with pkg-config"
  uses_prefix "$work/remote-pair-pc"
  "$work/remote-pair-pc" > "$work/remote-pair-pc.log" || fail "the pkg-config remote example (see $work/remote-pair-pc.log)"
fi
step "both routes work"
