#!/usr/bin/env bash
# The main job: installs what it needs, builds and installs the library, its
# plug-ins and icctl into build/install, then shows this machine's hardware
# with `icctl tree` and a few seconds of `icctl watch`.
#
#   scripts/run.sh                 this machine
#   scripts/run.sh --example large the large example server (examples/sysfs/large)
#   scripts/run.sh --example hostile a tree of hostile numbers and names, written
#                                  by examples/sysfs/make-hostile.sh
#   scripts/run.sh --example bmc   the small server with a simulated BMC
#                                  (examples/bmc, ipmi_sim on 127.0.0.1) as an
#                                  out-of-band BMC of the ipmi plug-in
set -euo pipefail
cd "$(dirname "$0")/.."

example=""
watch_seconds=${IC_WATCH_SECONDS:-5}
while [[ $# -gt 0 ]]; do
  case "$1" in
    --example) example=${2:?--example needs small or large}; shift 2 ;;
    *) echo "usage: $0 [--example small|large|degraded|hostile|bmc]" >&2; exit 2 ;;
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
elif [[ "$example" == bmc ]]; then
  # The simulator on loopback with its own state and ports, stopped on exit.
  sim="$PWD/build/examples/bmc"
  rm -rf "$sim" && mkdir -p "$sim/state"
  lan=${IC_BMC_PORT:-16230}
  trap 'examples/bmc/bmcsim.sh stop "$sim/state"' EXIT
  examples/bmc/bmcsim.sh start "$sim/state" "$lan" $((lan + 1))
  printf 'icbmc-secret\n' >"$sim/pw" && chmod 600 "$sim/pw"
  cat >"$sim/ipmi.conf" <<EOF
[bmc example]                 # the simulated BMC of examples/bmc
host = 127.0.0.1:$lan
user = monitor
password_file = $sim/pw
privilege = operator
workarounds = opensesspriv    # ipmi_sim needs it
EOF
  export IC_IPMI_CONFIG="$sim/ipmi.conf"
  icctl+=(--sysfs-root examples/sysfs/small)
elif [[ -n "$example" ]]; then
  icctl+=(--sysfs-root "examples/sysfs/$example")
fi

echo "=== icctl tree ==="
"${icctl[@]}" tree
if [[ "$example" == bmc ]]; then
  echo
  echo "=== icctl alerts ==="
  "${icctl[@]}" alerts
fi
echo
echo "=== icctl watch (${watch_seconds} s) ==="
"${icctl[@]}" watch --for "$watch_seconds"
