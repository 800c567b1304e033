#!/usr/bin/env bash
# The main job: installs what it needs, builds and installs the library, its
# plug-ins and icctl into build/install, then shows this machine's hardware
# with `icctl tree` and a few seconds of `icctl watch`.
#
#   scripts/run.sh                 this machine
#   scripts/run.sh --example large the large example server (examples/sysfs/large)
#   scripts/run.sh --example hostile a tree of hostile numbers and names, written
#                                  by examples/sysfs/make-hostile.sh
set -euo pipefail
cd "$(dirname "$0")/.."

example=""
watch_seconds=${IC_WATCH_SECONDS:-5}
while [[ $# -gt 0 ]]; do
  case "$1" in
    --example) example=${2:?--example needs small or large}; shift 2 ;;
    *) echo "usage: $0 [--example small|large]" >&2; exit 2 ;;
  esac
done

scripts/install-deps.sh

prefix="$PWD/build/install"
cmake -S . -B build/release -DCMAKE_BUILD_TYPE=Release -DIC_BUILD_TESTS=OFF \
  -DCMAKE_INSTALL_PREFIX="$prefix" >/dev/null
cmake --build build/release -j "$(nproc 2>/dev/null || echo 2)"
cmake --install build/release >/dev/null

icctl=("$prefix/bin/icctl")
if [[ "$example" == hostile ]]; then
  examples/sysfs/make-hostile.sh build/examples/hostile >/dev/null
  icctl+=(--sysfs-root build/examples/hostile)
elif [[ -n "$example" ]]; then
  icctl+=(--sysfs-root "examples/sysfs/$example")
fi

echo "=== icctl tree ==="
"${icctl[@]}" tree
echo
echo "=== icctl watch (${watch_seconds} s) ==="
"${icctl[@]}" watch --for "$watch_seconds"
