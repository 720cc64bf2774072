#!/bin/sh
# Measures what a host source pays for the library's headers: the seconds
# (user + system CPU, best of N runs, at -O0) to compile a source that
# declares one message type, and one that includes the umbrella header.
#   scripts/compile-time.sh [runs]     (CXX picks the compiler; default c++)
set -eu
root=$(cd "$(dirname "$0")/.." && pwd)
runs=${1:-5}
cxx=${CXX:-c++}
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT

cat > "$work/message.cpp" <<'SRC'
#include <TarnMessaging/MessageImpl.h>
struct Progress : Tarn::MessageImpl<Progress> {
  Progress(int inDone, int inTotal) : mDone(inDone), mTotal(inTotal) {}
  int mDone;
  int mTotal;
};
Tarn::Message* MakeCopy(int inDone) { return Progress(inDone, 100).Clone(); }
SRC
echo '#include <TarnMessaging.h>' > "$work/umbrella.cpp"

flags="-std=c++17 -O0 -I$root/Messaging/Include -I$root/Platform/kivcore/include -I$root/Platform/TarnFoundation/include"
for source in message umbrella; do
  best=
  i=0
  while [ "$i" -lt "$runs" ]; do
    # GNU time prints user and system seconds; their sum is immune to the
    # waiting that a busy machine adds to wall time.
    t=$( { /usr/bin/time -f '%U %S' $cxx $flags -c -o /dev/null "$work/$source.cpp"; } 2>&1 | tail -n 1 |
        awk '{ printf "%.2f", $1 + $2 }')
    if [ -z "$best" ] || [ "$(echo "$t $best" | awk '{ print ($1 < $2) }')" = 1 ]; then best=$t; fi
    i=$((i + 1))
  done
  echo "$source: ${best}s"
done
